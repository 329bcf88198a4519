# bash completion for qmkit, the command-line client of qmd.
# Needs nothing but bash; works with or without the bash-completion package.

# UUIDs of the plug-ins the daemon would use: the first field of the lines
# of `qmkit list` that end in "valid" (refused bundles have "-" there, and
# the daemon answers "no such plugin" for invalid ones). $1 is the -S
# service, if any.
_qmkit_plugin_uuids() {
    local -a service=()
    [[ -n $1 ]] && service=(-S "$1")
    qmkit "${service[@]}" --timeout 2 list 2>/dev/null | awk -F '\t' '$1 != "-" && $6 == "valid" { print $1 }'
}

# Hold tokens: the first column of `qmkit holds`, below its header line.
_qmkit_hold_tokens() {
    local -a service=()
    [[ -n $1 ]] && service=(-S "$1")
    qmkit "${service[@]}" --timeout 2 holds 2>/dev/null | awk 'NR > 1 { print $1 }'
}

# Extension points: the fourth field of `qmkit list`, without the "-" of
# bundles that have none.
_qmkit_extension_points() {
    local -a service=()
    [[ -n $1 ]] && service=(-S "$1")
    qmkit "${service[@]}" --timeout 2 list 2>/dev/null | awk -F '\t' '$4 != "-" { print $4 }' | sort -u
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
    local globals="-S --json --timeout --help -h --version"
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

    # Every command takes --help and -h.
    local options="--help -h"
    case $command in
        bulk|hold) options="--flags $options" ;;
        inspect) options="-i --sdk-dir -v --provenance --json $options" ;;
        list) options="--point $options" ;;
        send) options="- $options" ;;
    esac
    case $prev in
        --flags)
            # What hold's paths name: 1 applications, 2 plug-in bundles.
            [[ $command == hold ]] && mapfile -t COMPREPLY < <(compgen -W "1 2" -- "$cur")
            return 0 ;;
        -i) return 0 ;;
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
