#!/bin/sh
# Prints a help2man include with a COMMANDS section: every command that `CTL --help` lists, and
# the commands of those (defaults read, ...), each with the text of `CTL COMMAND --help`. The
# programs' help stays the one source of the manual page.
# usage: commands.sh CTL OUTPUT
set -eu
ctl=$1
exec > "$2"

# Escapes text for roff: backslashes, hyphens, and lines that would read as requests.
roff() {
    sed -e 's/\\/\\e/g' -e 's/-/\\-/g' -e "s/^\\([.']\\)/\\\\\\&\\1/"
}

# The commands listed by the help on standard input.
commands_in() {
    sed -n '/^Commands:/,/^$/p' | sed -n 's/^  \([a-z][a-z-]*\).*/\1/p'
}

# The entry of `CTL WORDS...`: its usage line and summary, then the rest of its help as printed,
# less the help flag and the options every command shares (the OPTIONS section has those).
describe() {
    help=$("$ctl" "$@" --help)
    echo ".TP"
    printf '.B %s\n' "$(printf '%s\n' "$help" | sed -n 's/^Usage: //p' | roff)"
    printf '%s\n' "$help" | sed -n 1p | roff
    echo ".nf"
    # A heading ("Options:") only where lines of it remain.
    printf '%s\n' "$help" | awk '
        NR == 1 || /^Usage: |^  -h,--help|^$/ { next }
        /^Global options:/ { exit }
        /^[A-Z][a-z]*:$/ { heading = $0; next }
        /^  / && heading != "" { print heading }
        { heading = ""; print }' | roff
    echo ".fi"
    for command in $(printf '%s\n' "$help" | commands_in); do
        describe "$@" "$command"
    done
}

echo "[COMMANDS]"
for command in $("$ctl" --help | commands_in); do
    describe "$command"
done
