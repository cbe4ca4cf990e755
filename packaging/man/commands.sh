#!/bin/sh
# Prints a help2man include with a COMMANDS section: every command that `CTL --help` lists,
# each with the text of `CTL COMMAND --help`. The programs' help stays the one source of the
# manual page.
# usage: commands.sh CTL OUTPUT
set -eu
ctl=$1
exec > "$2"

# Escapes text for roff: backslashes, hyphens, and lines that would read as requests.
roff() {
    sed -e 's/\\/\\e/g' -e 's/-/\\-/g' -e "s/^\\([.']\\)/\\\\\\&\\1/"
}

echo "[COMMANDS]"
commands=$("$ctl" --help | sed -n '/^Commands:/,/^$/p' | sed -n 's/^  \([a-z][a-z-]*\).*/\1/p')
for command in $commands; do
    help=$("$ctl" "$command" --help)
    usage=$(printf '%s\n' "$help" | sed -n '1s/^[Uu]sage: sxreportctl \[options\] /sxreportctl /p')
    echo ".TP"
    printf '.B %s\n' "$(printf '%s\n' "$usage" | roff)"
    # The text between the usage line and the options every command shares.
    printf '%s\n' "$help" | sed -e '1,2d' -e '/^Options:/,$d' -e '/^$/d' | roff
done
