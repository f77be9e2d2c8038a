# Completion of ternhactl's commands and options, for bash.
_ternhactl() {
    local word=${COMP_WORDS[COMP_CWORD]} previous=${COMP_WORDS[COMP_CWORD - 1]} command='' i
    local commands='status rebooting reboot-peer disks check metrics' options='--socket --timeout --help --version'

    case $previous in
        --socket)
            mapfile -t COMPREPLY < <(compgen -f -- "$word")
            return
            ;;
        --timeout)
            return
            ;;
    esac
    for ((i = 1; i < COMP_CWORD; i++)); do
        if [[ " $commands " == *" ${COMP_WORDS[i]} "* && ${COMP_WORDS[i - 1]} != --socket ]]; then
            command=${COMP_WORDS[i]}
        fi
    done
    case $command in
        '') options="$commands $options" ;;
        status) options='--json --watch --socket --timeout --help' ;;
        reboot-peer) options='--yes --socket --timeout --help' ;;
        *) options='--socket --timeout --help' ;;
    esac
    mapfile -t COMPREPLY < <(compgen -W "$options" -- "$word")
}
complete -F _ternhactl ternhactl
