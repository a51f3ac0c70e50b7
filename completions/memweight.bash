# Completion of memweight in bash.

# Matched here and not by `compgen -W`, which would expand what is in the name of a file that somebody runs.
_memweight_add_matches() {
    local prefix=$1 word
    while IFS= read -r word; do
        if [[ $word == "$prefix"* ]]; then
            COMPREPLY+=("$(printf %q "$word")")
        fi
    done
}

_memweight_pids() {
    printf '%s\n' /proc/[0-9]* | sed 's|.*/||'
}

# File names of the programs that run, as far as the user may know them.
_memweight_names() {
    readlink /proc/[0-9]*/exe | sed 's/ (deleted)$//; s|.*/||' | sort -u
}

_memweight() {
    local word=${COMP_WORDS[COMP_CWORD]} option=${COMP_WORDS[COMP_CWORD - 1]}
    COMPREPLY=()
    # "--option=word" comes as three words.
    if [[ $word == = ]]; then
        word=
    elif [[ $option == = ]]; then
        option=${COMP_WORDS[COMP_CWORD - 2]}
    fi
    case $option in
        -j | --json | --statpack)
            compopt -o filenames
            mapfile -t COMPREPLY < <(compgen -f -- "$word")
            return
            ;;
        -f | --format)
            mapfile -t COMPREPLY < <(compgen -W 'bytes formatted pages' -- "$word")
            return
            ;;
        --sort)
            mapfile -t COMPREPLY < <(compgen -W 'dirty swapped clean reclaimable wired regions category' -- "$word")
            return
            ;;
        --sample)
            return
            ;;
        --pid)
            _memweight_add_matches "$word" < <(_memweight_pids)
            return
            ;;
    esac
    if [[ $word == -* ]]; then
        mapfile -t COMPREPLY < <(compgen -W '-a --all -j --json --statpack -h --help -t --targetChildren -p --proc --pid
            -x --exclude -s --skip -v -f --format --sort --vmObjectDirty -w --wide --swapped --wired --unmapped
            --sample --version' -- "$word")
        return
    fi
    if [[ $word == [0-9]* ]]; then
        _memweight_add_matches "$word" < <(_memweight_pids)
    fi
    _memweight_add_matches "$word" < <(_memweight_names)
    if [[ $option != -x && $option != --exclude ]]; then
        _memweight_add_matches "$word" < <(compgen -f -X '!*.heapsnap' -- "$word"; compgen -d -S / -- "$word")
    fi
}

complete -F _memweight memweight
