# bash completion for qmkit, the command-line client of qmd.
# Needs nothing but bash; works with or without the bash-completion package.

# Plug-in UUIDs from the daemon: the first field of `qmkit list`, without
# the "-" of bundles the catalog refused. $1 is the -S service, if any.
_qmkit_plugin_uuids() {
    local -a service=()
    [[ -n $1 ]] && service=(-S "$1")
    qmkit "${service[@]}" --timeout 2 list 2>/dev/null | cut -f1 | grep -v '^-$'
}

# Hold tokens: the first column of `qmkit holds`, below its header line.
_qmkit_hold_tokens() {
    local -a service=()
    [[ -n $1 ]] && service=(-S "$1")
    qmkit "${service[@]}" --timeout 2 holds 2>/dev/null | awk 'NR > 1 { print $1 }'
}

_qmkit_extension_points() {
    local -a service=()
    [[ -n $1 ]] && service=(-S "$1")
    qmkit "${service[@]}" --timeout 2 list 2>/dev/null | cut -f4 | sort -u
}

# Bundles and applications are directories.
_qmkit_directories() {
    compopt -o filenames 2>/dev/null
    mapfile -t COMPREPLY < <(compgen -d -- "$1")
}

_qmkit() {
    local cur=${COMP_WORDS[COMP_CWORD]}
    local prev=${COMP_WORDS[COMP_CWORD-1]}
    local commands="access bulk hold holds inspect list ready release send token watch"
    local globals="-S --json --timeout --help --version"
    COMPREPLY=()

    # The global options before the command, and where the command is.
    local service="" command="" i=1 word
    while (( i < COMP_CWORD )); do
        word=${COMP_WORDS[i]}
        case $word in
            -S) service=${COMP_WORDS[i+1]}; (( i += 2 )); continue ;;
            -S*) service=${word#-S} ;;
            --timeout) (( i += 2 )); continue ;;
            -*) ;;
            *) command=$word; break ;;
        esac
        (( i += 1 ))
    done

    if [[ -z $command ]]; then
        case $prev in
            -S|--timeout) return 0 ;;
        esac
        if [[ $cur == -* ]]; then
            mapfile -t COMPREPLY < <(compgen -W "$globals" -- "$cur")
        else
            mapfile -t COMPREPLY < <(compgen -W "$commands" -- "$cur")
        fi
        return 0
    fi

    local options="--help"
    case $command in
        bulk|hold) options="--flags --help" ;;
        inspect) options="-i --sdk-dir -v --provenance --json --help" ;;
        list) options="--point --help" ;;
        send) options="- --help" ;;
    esac
    case $prev in
        --flags|-i) return 0 ;;
        --sdk-dir) _qmkit_directories "$cur"; return 0 ;;
        --point)
            mapfile -t COMPREPLY < <(compgen -W "$(_qmkit_extension_points "$service")" -- "$cur")
            return 0 ;;
    esac
    if [[ $cur == -* ]]; then
        mapfile -t COMPREPLY < <(compgen -W "$options" -- "$cur")
        return 0
    fi
    case $command in
        access|ready)
            mapfile -t COMPREPLY < <(compgen -W "$(_qmkit_plugin_uuids "$service")" -- "$cur") ;;
        release)
            mapfile -t COMPREPLY < <(compgen -W "$(_qmkit_hold_tokens "$service")" -- "$cur") ;;
        hold|inspect)
            _qmkit_directories "$cur" ;;
        token)
            (( COMP_CWORD == i + 1 )) && mapfile -t COMPREPLY < <(compgen -W "verify" -- "$cur") ;;
    esac
    return 0
}

complete -F _qmkit qmkit
