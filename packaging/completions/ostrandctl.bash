# Completion of ostrandctl's command line for bash. The program itself says what may come next.

_ostrandctl() {
    local word=${COMP_WORDS[COMP_CWORD]} candidates
    [[ $word != = ]] || word=
    mapfile -t candidates < <("${COMP_WORDS[0]}" __complete -- "${COMP_WORDS[@]:1:COMP_CWORD}" 2>/dev/null)
    case ${candidates[0]-} in
    :files) mapfile -t COMPREPLY < <(compgen -f -- "$word") ;;
    :directories) mapfile -t COMPREPLY < <(compgen -d -- "$word") ;;
    :programs) mapfile -t COMPREPLY < <(compgen -c -f -- "$word") ;;
    *) COMPREPLY=("${candidates[@]}") && return ;;
    esac
    compopt -o filenames 2>/dev/null
} && complete -F _ostrandctl ostrandctl
