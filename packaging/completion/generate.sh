#!/bin/sh
# Writes the bash completion of sxreportctl from the program's own help, so that it knows
# every command and option the build has: the commands `CTL --help` lists, its global options,
# and for each command its options and its own commands as keywords (`defaults read|write|...`).
# Options written with an uppercase value (`--socket PATH`) take one; PATH and DIR values
# complete as file names. The completion logic itself is completion.bash, appended unchanged.
# usage: generate.sh CTL OUTPUT
set -eu
ctl=$1
here=$(dirname "$0")
exec > "$2"

# The commands listed by the help on standard input.
commands_in() {
    sed -n '/^Commands:/,/^$/p' | sed -n 's/^  \([a-z][a-z-]*\).*/\1/p'
}

# "--name VALUE" pairs of the Options section of the help on standard input, one a line; VALUE
# is empty for a flag.
options_in() {
    sed -n '/^Options:/,/^$/p' |
        sed -n 's/^  \(-h,\)\{0,1\}\(--[a-z][a-z-]*\)\( \([A-Z][A-Z_]*\)\)\{0,1\}.*/\2 \4/p'
}

help=$("$ctl" --help)
commands=$(printf '%s\n' "$help" | commands_in)
global=$(printf '%s\n' "$help" | options_in)

words() { tr '\n' ' ' | sed 's/^ *//; s/ *$//'; }

echo "# bash completion for sxreportctl, generated from its --help by packaging/completion/generate.sh."
echo "_sxreportctl_commands='$(printf '%s\n' "$commands" | words)'"
echo "_sxreportctl_global_options='$(printf '%s\n' "$global" | cut -d' ' -f1 | words) -h'"

# Options that take a value, and those whose value is a path.
value_options=$(printf '%s\n' "$global" | awk 'NF == 2 { print $1 }')
path_options=$(printf '%s\n' "$global" | awk '$2 == "PATH" || $2 == "DIR" { print $1 }')

echo "_sxreportctl_command_words() {"
echo "    case \$1 in"
for command in $commands; do
    # Its options and its own commands (defaults read|write|delete) with their options.
    keywords=$("$ctl" "$command" --help | commands_in)
    options=$(for keyword in "" $keywords; do "$ctl" "$command" $keyword --help | options_in; done |
        grep -v '^--help ' | sort -u)
    value_options="$value_options
$(printf '%s\n' "$options" | awk 'NF == 2 { print $1 }')"
    echo "        $command) echo '$( (printf '%s\n' "$options" | cut -d' ' -f1; printf '%s\n' "$keywords") | words)' ;;"
done
echo "    esac"
echo "}"
echo "_sxreportctl_value_options=' $(printf '%s\n' "$value_options" | grep . | sort -u | words) '"
echo "_sxreportctl_path_options=' $(printf '%s\n' "$path_options" | words) '"
echo
cat "$here/completion.bash"
