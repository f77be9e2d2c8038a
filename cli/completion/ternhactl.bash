# Completion of ternhactl's commands and options, for bash.
_ternhactl() {
    local word=${COMP_WORDS[COMP_CWORD]} previous=${COMP_WORDS[COMP_CWORD - 1]} command='' i
    local commands='status wait events rebooting reboot-peer disks check metrics' options='--socket --timeout --help --version'

    case $previous in
        --socket | --output)
            mapfile -t COMPREPLY < <(compgen -f -- "$word")
            return
            ;;
        --timeout)
            return
            ;;
        wait)
            mapfile -t COMPREPLY < <(compgen -W "peer-alive peer-dead peer-rebooting peer-not-rebooting peer-resync
                peer-no-resync peer-disk-errors peer-no-disk-errors connected not-connected resync no-resync
                disk-errors no-disk-errors" -- "$word")
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
        events) options='--json --socket --timeout --help' ;;
        check) options='--self --socket --timeout --help' ;;
        metrics) options='--output --socket --timeout --help' ;;
        reboot-peer) options='--yes --socket --timeout --help' ;;
        *) options='--socket --timeout --help' ;;
    esac
    mapfile -t COMPREPLY < <(compgen -W "$options" -- "$word")
}
complete -F _ternhactl ternhactl
