# Completion of memweight-heapsnap in bash.

_memweight_heapsnap() {
    local word=${COMP_WORDS[COMP_CWORD]} option=${COMP_WORDS[COMP_CWORD - 1]}
    COMPREPLY=()
    # "--option=word" comes as three words.
    if [[ $word == = ]]; then
        word=
    elif [[ $option == = ]]; then
        option=${COMP_WORDS[COMP_CWORD - 2]}
    fi
    if [[ $option == -o || $option == --output ]]; then
        compopt -o filenames
        mapfile -t COMPREPLY < <(compgen -f -- "$word")
    elif [[ $word == -* ]]; then
        mapfile -t COMPREPLY < <(compgen -W '-o --output -f --force --vmObjectDirty -h --help --version' -- "$word")
    else
        mapfile -t COMPREPLY < <(compgen -W "$(printf '%s\n' /proc/[0-9]* | sed 's|.*/||')" -- "$word")
    fi
}

complete -F _memweight_heapsnap memweight-heapsnap
