# bash completion of berthctl: berthctl itself names the candidates for the
# word being completed (subcommands, options, container class names).
_berthctl() {
    local cur=${COMP_WORDS[COMP_CWORD]}
    local IFS=$'\n'
    COMPREPLY=($(compgen -W "$("${COMP_WORDS[0]}" __complete "${COMP_WORDS[@]:1:COMP_CWORD}" 2>/dev/null)" -- "$cur"))
}
complete -F _berthctl berthctl
