# bash completion of qvreportctl. The candidates come from qvreportctl itself: its hidden
# `__complete` walks the same command-line definition that parses, and reads the sink and suite
# names from the state directory (--state-dir on the line, else the default one).
_qvreportctl() {
    local cur="${COMP_WORDS[COMP_CWORD]}"
    local IFS=$'\n'
    local -a candidates
    candidates=($("${COMP_WORDS[0]}" __complete -- "${COMP_WORDS[@]:1:COMP_CWORD}" 2>/dev/null))
    case "${candidates[0]-}" in
        @files)
            compopt -o filenames 2>/dev/null
            COMPREPLY=($(compgen -f -- "$cur"))
            ;;
        @dirs)
            compopt -o filenames 2>/dev/null
            COMPREPLY=($(compgen -d -- "$cur"))
            ;;
        *)
            COMPREPLY=("${candidates[@]}")
            ;;
    esac
}
complete -F _qvreportctl qvreportctl
