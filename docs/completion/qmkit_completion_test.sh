#!/usr/bin/env bash
# Checks docs/completion/qmkit.bash: subcommands, options, directories, and
# UUIDs and tokens taken from a stub qmkit placed first on PATH (which also
# records its arguments, so we see that an earlier -S is passed on).
set -u
here=$(cd "$(dirname "$0")" && pwd)
work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT

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
      - ovaro.example.broken - ovaro.widget /a/Broken.bundle 'invalid: no Info.plist' ;;
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
# expect "LINE" "EXPECTED WORDS": completes the last word of LINE (a line
# ending in a space completes an empty word) and compares the sorted result.
expect() {
    local line=$1 expected=$2
    read -ra COMP_WORDS <<< "$line"
    [[ $line == *" " ]] && COMP_WORDS+=("")
    COMP_CWORD=$(( ${#COMP_WORDS[@]} - 1 ))
    COMP_LINE=$line COMP_POINT=${#line}
    _qmkit
    local got
    got=$(printf '%s\n' "${COMPREPLY[@]}" | LC_ALL=C sort | xargs)
    if [[ $got != "$expected" ]]; then
        echo "FAILED: '$line' completed to '$got', expected '$expected'"
        failures=$(( failures + 1 ))
    fi
}

expect "qmkit " "access bulk hold holds inspect list ready release send token watch"
expect "qmkit h" "hold holds"
expect "qmkit --json -S svc --timeout 5 re" "ready release"
expect "qmkit --" "--help --json --timeout --version"
expect "qmkit -S " ""
expect "qmkit inspect --" "--help --json --provenance --sdk-dir"
expect "qmkit inspect -" "--help --json --provenance --sdk-dir -i -v"
expect "qmkit bulk --" "--flags --help"
expect "qmkit list --" "--help --point"
expect "qmkit token " "verify"
expect "qmkit token verify " ""

cd "$work/tree" || exit 1
expect "qmkit hold N" "Notes.app"
expect "qmkit inspect --sdk-dir S" "SDKs"
expect "qmkit inspect " "Notes.app SDKs"  # no file.txt: bundles are directories

expect "qmkit ready " "7c2d10d6-29d3-4858-a2a3-c8c202a96ec9 7d000000-0000-0000-0000-000000000001"
expect "qmkit access 7c" "7c2d10d6-29d3-4858-a2a3-c8c202a96ec9"
expect "qmkit release " "279f4ac2-79fd-4a6e-b668-e81ae71aa878"
expect "qmkit list --point ovaro.w" "ovaro.widget"
: > "$QMKIT_STUB_LOG"
expect "qmkit -S other.service ready 7d" "7d000000-0000-0000-0000-000000000001"
expect "qmkit -Sthird ready 7d" "7d000000-0000-0000-0000-000000000001"
calls=$(cat "$QMKIT_STUB_LOG")
if [[ $calls != *"-S other.service "*"list"* || $calls != *"-S third "*"list"* ]]; then
    echo "FAILED: -S was not passed on to 'qmkit list': $calls"
    failures=$(( failures + 1 ))
fi

(( failures == 0 )) && echo "all completions as expected"
exit $(( failures != 0 ))
