#!/usr/bin/env bash
# Checks docs/completion/qmkit.bash.
#
#   qmkit_completion_test.sh [BUILD-DIR]
#
# First against a stub qmkit placed first on PATH (which also records its
# arguments, so we see that an earlier -S is passed on): subcommands, every
# subcommand's options, directories, UUIDs and tokens. Then, given the build
# folder, against the real qmkit and a qmd serving the bundled examples, so
# that the completion reads what `qmkit list` and `qmkit holds` really print
# and offers every option the commands' --help texts name.
set -u
here=$(cd "$(dirname "$0")" && pwd)
top=$(cd "$here/../.." && pwd -P)  # the catalog reports resolved paths
build=${1:-}
work=$(mktemp -d)
qmd_pid="" hold_pid=""
cleanup() {
    [[ -n $hold_pid ]] && kill "$hold_pid" 2>/dev/null
    [[ -n $qmd_pid ]] && kill "$qmd_pid" 2>/dev/null && wait "$qmd_pid" 2>/dev/null
    rm -rf "$work"
}
trap cleanup EXIT

mkdir -p "$work/bin" "$work/tree/Notes.app" "$work/tree/SDKs"
touch "$work/tree/file.txt"
cat > "$work/bin/qmkit" <<'EOF'
#!/usr/bin/env bash
echo "$*" >> "$QMKIT_STUB_LOG"
case " $* " in
  *" list "*)
    printf '%s\t%s\t%s\t%s\t%s\t%s\n' \
      7c2d10d6-29d3-4858-a2a3-c8c202a96ec9 ovaro.example.share 3.1 ovaro.share-services /a/Share.bundle valid \
      7d000000-0000-0000-0000-000000000001 ovaro.example.widget 1.0 ovaro.widget /a/W.xbun valid \
      7e000000-0000-0000-0000-000000000002 ovaro.example.hybrid - ovaro.hybrid /a/Hybrid.bundle \
        'invalid: hybrid plug-ins are not supported on this platform' \
      - - - - /a/Broken.bundle 'invalid: unreadable Info.plist' ;;
  *" holds "*)
    printf 'TOKEN  PID  AGE  PLUG-INS  EXECUTABLE\n'
    printf '279f4ac2-79fd-4a6e-b668-e81ae71aa878  42  3s  1  /usr/bin/qmkit\n' ;;
esac
EOF
chmod +x "$work/bin/qmkit"
export PATH="$work/bin:$PATH" QMKIT_STUB_LOG="$work/calls"
: > "$QMKIT_STUB_LOG"

# shellcheck source=qmkit.bash
source "$here/qmkit.bash"

failures=0
# completions "LINE": the sorted words completing the last word of LINE (a
# line ending in a space completes an empty word), on one line.
completions() {
    local line=$1
    read -ra COMP_WORDS <<< "$line"
    [[ $line == *" " ]] && COMP_WORDS+=("")
    COMP_CWORD=$(( ${#COMP_WORDS[@]} - 1 ))
    COMP_LINE=$line COMP_POINT=${#line}
    _qmkit
    printf '%s\n' "${COMPREPLY[@]}" | LC_ALL=C sort | xargs
}
# expect "LINE" "EXPECTED WORDS"
expect() {
    local got
    got=$(completions "$1")
    if [[ $got != "$2" ]]; then
        echo "FAILED: '$1' completed to '$got', expected '$2'"
        failures=$(( failures + 1 ))
    fi
}

expect "qmkit " "access bulk hold holds inspect list ready release send token watch"
expect "qmkit h" "hold holds"
expect "qmkit --json -S svc --timeout 5 re" "ready release"
expect "qmkit -" "--help --json --timeout --version -S -h"
expect "qmkit -S " ""
expect "qmkit --timeout " ""

# Every subcommand's options, as its --help lists them.
while read -r command options; do
    expect "qmkit $command -" "$options"
done <<'TABLE'
access --help -h
bulk --flags --help -h
hold --flags --help -h
holds --help -h
inspect --help --json --provenance --sdk-dir -h -i -v
list --help --point -h
ready --help -h
release --help -h
send - --help -h
token --help -h
watch --help -h
TABLE
expect "qmkit inspect --" "--help --json --provenance --sdk-dir"
expect "qmkit hold /x --flags " "1 2"
expect "qmkit bulk --flags " ""
expect "qmkit inspect -i " ""
expect "qmkit token " "verify"
expect "qmkit token verify " ""
expect "qmkit holds " ""
expect "qmkit watch " ""

cd "$work/tree" || exit 1
expect "qmkit hold N" "Notes.app"
expect "qmkit inspect --sdk-dir S" "SDKs"
expect "qmkit inspect " "Notes.app SDKs"  # no file.txt: bundles are directories

# UUIDs where a UUID is expected: the plug-ins qmkit lists as valid only.
expect "qmkit ready " "7c2d10d6-29d3-4858-a2a3-c8c202a96ec9 7d000000-0000-0000-0000-000000000001"
expect "qmkit access 7c" "7c2d10d6-29d3-4858-a2a3-c8c202a96ec9"
expect "qmkit access 7c2d10d6-29d3-4858-a2a3-c8c202a96ec9 7" \
       "7c2d10d6-29d3-4858-a2a3-c8c202a96ec9 7d000000-0000-0000-0000-000000000001"
expect "qmkit release " "279f4ac2-79fd-4a6e-b668-e81ae71aa878"
expect "qmkit list --point " "ovaro.hybrid ovaro.share-services ovaro.widget"
expect "qmkit list --point ovaro.w" "ovaro.widget"
: > "$QMKIT_STUB_LOG"
expect "qmkit -S other.service ready 7d" "7d000000-0000-0000-0000-000000000001"
expect "qmkit -Sthird ready 7d" "7d000000-0000-0000-0000-000000000001"
calls=$(cat "$QMKIT_STUB_LOG")
if [[ $calls != *"-S other.service "*"list"* || $calls != *"-S third "*"list"* ]]; then
    echo "FAILED: -S was not passed on to 'qmkit list': $calls"
    failures=$(( failures + 1 ))
fi

# --- The real qmkit, and a daemon on the bundled examples.
if [[ -n $build ]]; then
    PATH="$build:${PATH#"$work/bin:"}"
    [[ $(type -P qmkit) == "$build/qmkit" ]] || { echo "FAILED: no qmkit in $build"; exit 1; }
    export QM_DUCT_DIR="$work/duct" XDG_DATA_HOME="$work/data" XDG_CONFIG_HOME="$work/config" \
           XDG_STATE_HOME="$work/state" QM_SYSTEM_ROOTS="$top/examples/Applications" \
           QM_SDK_PATH="$top/examples/SDKs"
    "$build/qmd" 2>"$work/qmd.log" &
    qmd_pid=$!
    for _ in $(seq 200); do
        qmkit --timeout 1 bulk 2>/dev/null && break
        sleep 0.1
    done
    # What the daemon says, read from its JSON rather than from the lines the
    # completion reads.
    listed() {
        qmkit --json list | /usr/bin/python3 -c 'import json, sys
entries = json.load(sys.stdin)
if sys.argv[1] == "uuids":
    print(" ".join(sorted(e["uuid"] for e in entries if e["valid"])))
else:
    print(" ".join(sorted({e["point"] for e in entries if e["point"]})))' "$1"
    }
    uuids=$(listed uuids)
    [[ $(wc -w <<< "$uuids") -eq 6 ]] || { echo "FAILED: the examples should hold 6 valid plug-ins: '$uuids'"; cat "$work/qmd.log"; exit 1; }
    expect "qmkit ready " "$uuids"
    expect "qmkit --json access " "$uuids"
    expect "qmkit list --point " "$(listed points)"
    expect "qmkit list --point ovaro.sh" "ovaro.share-services"

    # Every option each command's --help names is completed (the global
    # ones appear in every usage line and are completed before the command).
    for command in $(qmkit --help | awk '/^commands:/ { listing = 1; next } listing && /^  [a-z]/ { print $1 }'); do
        offered=" $(completions "qmkit $command -") "
        for option in $(qmkit "$command" --help | grep -oE '(^|[ [])--?[A-Za-z][A-Za-z-]*' | tr -d ' [' | sort -u |
                        grep -vxE -- '-S|--json|--timeout') --help -h; do
            [[ $offered == *" $option "* ]] || {
                echo "FAILED: 'qmkit $command -' does not offer $option:$offered"
                failures=$(( failures + 1 ))
            }
        done
    done

    qmkit hold "$top/examples/Applications/Notes.app" > "$work/token" &
    hold_pid=$!
    for _ in $(seq 100); do
        [[ -s $work/token ]] && break
        sleep 0.1
    done
    expect "qmkit release " "$(cat "$work/token")"
fi

(( failures == 0 )) && echo "all completions as expected"
exit $(( failures != 0 ))
