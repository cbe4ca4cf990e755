#!/bin/sh
# Writes the bash completion of sxreportctl from the program's own help, so that it knows
# every command and option the build has: the commands `CTL --help` lists, its global options,
# and for each command the options and keywords of its usage line (`defaults read|write|...`).
# Options written with an uppercase value (`--socket PATH`) take one; PATH and DIR values
# complete as file names. The completion logic itself is completion.bash, appended unchanged.
# usage: generate.sh CTL OUTPUT
set -eu
ctl=$1
here=$(dirname "$0")
exec > "$2"

help=$("$ctl" --help)
commands=$(printf '%s\n' "$help" | sed -n '/^Commands:/,/^$/p' | sed -n 's/^  \([a-z][a-z-]*\).*/\1/p')

# "--name VALUE" pairs of the Options section, one a line; VALUE is empty for a flag.
global=$(printf '%s\n' "$help" | sed -n '/^Options:/,/^$/p' |
    sed -n 's/^  \(-h, \)\{0,1\}\(--[a-z][a-z-]*\)\( \([A-Z][A-Z_]*\)\)\{0,1\}.*/\2 \4/p')

# The usage line of a command without "usage: sxreportctl [options] COMMAND".
usage_of() {
    "$ctl" "$1" --help | sed -n "1s/^usage: sxreportctl \[options\] $1//p"
}

words() { tr '\n' ' ' | sed 's/ *$//'; }

echo "# bash completion for sxreportctl, generated from its --help by packaging/completion/generate.sh."
echo "_sxreportctl_commands='$(printf '%s\n' "$commands" | words)'"
echo "_sxreportctl_global_options='$(printf '%s\n' "$global" | cut -d' ' -f1 | words) -h'"

# Options that take a value, and those whose value is a path.
value_options=$(printf '%s\n' "$global" | awk 'NF == 2 { print $1 }')
path_options=$(printf '%s\n' "$global" | awk '$2 == "PATH" || $2 == "DIR" { print $1 }')

echo "_sxreportctl_command_words() {"
echo "    case \$1 in"
for command in $commands; do
    usage=$(usage_of "$command")
    # Options of the usage line; an option followed by an uppercase word takes a value.
    options=$(printf '%s\n' "$usage" | grep -o -e '--[a-z][a-z-]*' | sort -u | words)
    value_options="$value_options
$(printf '%s\n' "$usage" | grep -o -e '--[a-z][a-z-]* [A-Z]' | cut -d' ' -f1)"
    # Bare lowercase words are keywords (defaults read|write|delete).
    keywords=$(printf '%s\n' "$usage" | tr ' |[]()' '\n' | grep -x '[a-z][a-z-]*' | words)
    echo "        $command) echo '$(echo "$options $keywords" | sed 's/^ *//; s/ *$//')' ;;"
done
echo "    esac"
echo "}"
echo "_sxreportctl_value_options=' $(printf '%s\n' "$value_options" | grep . | sort -u | words) '"
echo "_sxreportctl_path_options=' $(printf '%s\n' "$path_options" | words) '"
echo
cat "$here/completion.bash"
