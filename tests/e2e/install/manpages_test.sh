#!/bin/sh
# The manual pages are generated from the programs' --help; this checks that every option the
# programs print, and every sxreportctl command, is in the generated page.
# usage: manpages_test.sh SXREPORTINGD SXREPORTCTL MANDIR
set -eu
daemon=$1 ctl=$2 mandir=$3
failures=0 checked=0

# The page as plain text: roff hyphens and font changes undone.
page_text() {
    sed -e 's/\\-/-/g' -e 's/\\f[BIRP]//g' "$1"
}

expect_in_page() {  # PAGE WORD WHAT
    checked=$((checked + 1))
    if ! page_text "$1" | grep -q -F -e "$2"; then
        echo "FAIL: $(basename "$1") does not mention $3 '$2'"
        failures=$((failures + 1))
    fi
}

flags_of() {
    grep -o -e '--[a-z][a-z0-9-]*' | sort -u
}

for flag in $("$daemon" --help | flags_of); do
    expect_in_page "$mandir/sxreportingd.8" "$flag" "the sxreportingd option"
done

commands=$("$ctl" --help | sed -n '/^Commands:/,/^$/p' | sed -n 's/^  \([a-z][a-z-]*\).*/\1/p')
[ -n "$commands" ] || { echo "FAIL: sxreportctl --help lists no commands"; exit 1; }
for flag in $("$ctl" --help | flags_of); do
    expect_in_page "$mandir/sxreportctl.1" "$flag" "the sxreportctl option"
done
for command in $commands; do
    expect_in_page "$mandir/sxreportctl.1" "sxreportctl $command" "the command"
    for flag in $("$ctl" "$command" --help | flags_of); do
        expect_in_page "$mandir/sxreportctl.1" "$flag" "the $command option"
    done
done

# The pages render without a warning.
if command -v groff >/dev/null 2>&1; then
    for page in "$mandir/sxreportingd.8" "$mandir/sxreportctl.1"; do
        checked=$((checked + 1))
        warnings=$(groff -man -z -ww -Tutf8 "$page" 2>&1)
        if [ -n "$warnings" ]; then
            echo "FAIL: $(basename "$page") renders with warnings: $warnings"
            failures=$((failures + 1))
        fi
    done
fi

echo "manual pages: $checked checks, $failures failed"
[ "$failures" -eq 0 ]
