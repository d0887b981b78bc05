#compdef ostrandctl
# Completion of ostrandctl's command line for zsh. The program itself says what may come next.

local -a candidates
candidates=("${(@f)$("$words[1]" __complete -- "${(@)words[2,CURRENT]}" 2>/dev/null)}")
case $candidates[1] in
    :files) _files ;;
    :directories) _files -/ ;;
    :programs) _command_names -e || _files ;;
    ?*) compadd -a candidates ;;
    *) return 1 ;;
esac
