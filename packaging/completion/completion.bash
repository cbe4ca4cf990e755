# Completes a chain of commands joined by "then": a command name first in each link, then that
# command's keywords, or its options and the global ones after a "-". Values of PATH and DIR options
# complete as file names, other values not at all. The _sxreportctl_* tables come before this,
# from generate.sh.
# shellcheck disable=SC2154,SC2207
_sxreportctl() {
    local cur=${COMP_WORDS[COMP_CWORD]} prev=${COMP_WORDS[COMP_CWORD - 1]}
    local command='' word i
    COMPREPLY=()
    if [[ $_sxreportctl_value_options == *" $prev "* ]]; then
        if [[ $_sxreportctl_path_options == *" $prev "* ]]; then
            compopt -o filenames 2>/dev/null
            COMPREPLY=($(compgen -f -- "$cur"))
        fi
        return
    fi
    for ((i = 1; i < COMP_CWORD; i++)); do
        word=${COMP_WORDS[i]}
        if [[ $word == "then" ]]; then
            command=''
        elif [[ $_sxreportctl_value_options == *" $word "* ]]; then
            ((i++))  # its value
        elif [[ -z $command && $word != -* ]]; then
            command=$word
        fi
    done
    local candidates
    if [[ $cur == -* ]]; then
        candidates="$_sxreportctl_global_options"
        [[ -n $command ]] && candidates+=" $(_sxreportctl_command_words "$command")"
    elif [[ -z $command || $command == help ]]; then
        candidates="$_sxreportctl_commands"
        [[ -z $command ]] && candidates+=" help"
    else
        candidates="then"
        for word in $(_sxreportctl_command_words "$command"); do
            [[ $word == -* ]] || candidates+=" $word"
        done
    fi
    COMPREPLY=($(compgen -W "$candidates" -- "$cur"))
}
complete -F _sxreportctl sxreportctl
