# Completion of pelorus-doctor for bash.
_pelorus_doctor() {
    local current=${COMP_WORDS[COMP_CWORD]} previous=${COMP_WORDS[COMP_CWORD - 1]}
    # Readline takes the equals sign in --log=FILE for a word.
    [ "$previous" != = ] || previous=${COMP_WORDS[COMP_CWORD - 2]}
    [ "$current" != = ] || current=
    COMPREPLY=()
    case $previous in
    --log | --svg)
        compopt -o filenames
        mapfile -t COMPREPLY < <(compgen -f -- "$current")
        ;;
    *)
        mapfile -t COMPREPLY < <(compgen -W "--ask-service --help --json --log --no-probes
            --settings --share --svg --version -h" -- "$current")
        ;;
    esac
}
complete -F _pelorus_doctor pelorus-doctor
