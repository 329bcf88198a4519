#!/usr/bin/env bash
# `make install` end to end: installs the build into a temporary prefix,
# has systemd check the installed units, starts the installed qmd the way the
# socket unit does (systemd-socket-activate), drives it with the installed
# qmkit until it exits idle and is started again by the next connection, and
# builds and runs the example client through pkg-config alone. The man pages
# and the bash completion are in place, render and load.
#
#   install_test.sh BUILD-DIR LIBDIR [COMPILER-FLAGS]
# LIBDIR is the build's CMAKE_INSTALL_LIBDIR; COMPILER-FLAGS are added to the
# example's compile (a sanitized build's library needs its runtime).
set -euo pipefail

build=$1
libdir=$2
flags=${3:-}
top="$(realpath "$(dirname "$0")/../..")"  # the catalog reports resolved paths
tmp="$(mktemp -d)"
launcher_pid=""

stop_launcher() {
    [ -n "$launcher_pid" ] || return 0
    kill "$launcher_pid" 2>/dev/null || true  # the loop first, so that it starts nothing more
    wait "$launcher_pid" 2>/dev/null || true
    launcher_pid=""
    if [ -s "$tmp/activate.pid" ]; then
        kill "$(cat "$tmp/activate.pid")" 2>/dev/null || true
    fi
}
cleanup() {
    stop_launcher
    rm -rf "$tmp"
}
trap cleanup EXIT

fail() {
    echo "FAIL: $*" >&2
    if [ -f "$tmp/qmd.log" ]; then
        echo "--- qmd and launcher log:" >&2
        cat "$tmp/qmd.log" >&2
    fi
    exit 1
}

# Waits up to 20 s for the command to succeed.
eventually() {
    for _ in $(seq 200); do
        "$@" && return 0
        sleep 0.1
    done
    return 1
}
log_count() { grep -c -- "$1" "$tmp/qmd.log" || true; }
at_least() { [ "$(log_count "$1")" -ge "$2" ]; }

# --- DESTDIR stages the files; the units name the prefix, never DESTDIR.
DESTDIR="$tmp/stage" cmake --install "$build" --prefix /opt/qm >/dev/null
grep -qx "ExecStart=/opt/qm/bin/qmd" "$tmp/stage/opt/qm/lib/systemd/user/qmd.service" ||
    fail "a DESTDIR install names $(grep ExecStart "$tmp/stage/opt/qm/lib/systemd/user/qmd.service")"

# --- Every file where it belongs.
prefix="$tmp/prefix"
cmake --install "$build" --prefix "$prefix" >/dev/null
units="$prefix/lib/systemd/user"
for file in bin/qmd bin/qmkit "$libdir/libqmclient.so" "$libdir/pkgconfig/qmclient.pc" \
            include/qm/client/QMDaemonClient.h lib/systemd/user/qmd.socket lib/systemd/user/qmd.service \
            share/man/man8/qmd.8 share/man/man1/qmkit.1 share/bash-completion/completions/qmkit; do
    [ -e "$prefix/$file" ] || fail "$file was not installed"
done
grep -qx "ExecStart=$prefix/bin/qmd" "$units/qmd.service" || fail "ExecStart does not name the installed qmd"

# --- The installed man pages render, without a formatter warning, both as
# files and looked up by name in the installed tree, and are the pages of
# docs/man.
render() { LC_ALL=C MANPAGER=cat MANWIDTH=80 man "$@"; }
for page in man8/qmd.8 man1/qmkit.1; do
    name=$(basename "$page" | cut -d. -f1)
    section=${page:3:1}
    cmp -s "$prefix/share/man/$page" "$top/docs/man/$(basename "$page")" ||
        fail "the installed $page is not docs/man/$(basename "$page")"
    rendered=$(render --warnings -l "$prefix/share/man/$page" 2>"$tmp/man.err") ||
        fail "man -l $page failed: $(cat "$tmp/man.err")"
    [ ! -s "$tmp/man.err" ] || fail "man -l $page warns: $(cat "$tmp/man.err")"
    grep -q "^NAME" <<<"$rendered" && grep -q "^ *$name - " <<<"$rendered" ||
        fail "man -l $page renders no NAME section for $name: $rendered"
    [ "$rendered" = "$(render -M "$prefix/share/man" "$section" "$name" 2>&1)" ] ||
        fail "man -M $prefix/share/man $section $name does not find the installed page"
done

# --- The installed completion loads in a plain bash and completes the
# subcommands (bash-completion finds it by the command's name).
completed=$(bash --norc --noprofile -c 'source "$1" && complete -p qmkit >/dev/null &&
    COMP_WORDS=(qmkit w) COMP_CWORD=1 && _qmkit && echo "${COMPREPLY[*]}"' _ \
    "$prefix/share/bash-completion/completions/qmkit") || fail "the installed completion does not load"
[ "$completed" = "watch" ] || fail "the installed completion completes \"qmkit w\" to \"$completed\""

# --- systemd accepts the units: no error and no warning (an unknown key is
# only a warning), and their Documentation= pages exist.
export MANPATH="$prefix/share/man"
mkdir -m 0700 "$tmp/run"
verify=$(XDG_RUNTIME_DIR="$tmp/run" systemd-analyze verify --user --man=yes "$units/qmd.socket" "$units/qmd.service" 2>&1) ||
    fail "systemd-analyze verify: $verify"
[ -z "$verify" ] || fail "systemd-analyze verify warns: $verify"

# --- The public headers stand on their own with pkg-config's flags.
export PKG_CONFIG_PATH="$prefix/$libdir/pkgconfig"
(cd "$prefix/include/qm" && find . -name '*.h' | sed 's|^\./\(.*\)|#include "\1"|') >"$tmp/headers.cpp"
# shellcheck disable=SC2046
c++ -std=c++20 -fsyntax-only $(pkg-config --cflags qmclient) "$tmp/headers.cpp" || fail "the installed headers do not compile"

# --- The example client builds with the compiler and pkg-config alone.
# shellcheck disable=SC2046,SC2086
c++ -std=c++20 $flags -o "$tmp/qmclient-example" "$top/examples/client/main.cpp" $(pkg-config --cflags --libs qmclient) ||
    fail "the example client does not build"

# --- The service manager's part: hold the socket, start qmd on the first
# connection and again on the next one after it exits (systemd keeps the
# socket between the two; here each round binds it anew).
export QM_DUCT_DIR="$tmp/duct" QM_IDLE_EXIT=2 QM_LOG_STDERR=1 \
       XDG_DATA_HOME="$tmp/data" XDG_CONFIG_HOME="$tmp/config" XDG_STATE_HOME="$tmp/state" \
       QM_SYSTEM_ROOTS="$top/examples/Applications" QM_SDK_PATH="$top/examples/SDKs" \
       LD_LIBRARY_PATH="$prefix/$libdir${LD_LIBRARY_PATH:+:$LD_LIBRARY_PATH}"
mkdir -m 0700 "$QM_DUCT_DIR"
socket="$QM_DUCT_DIR/ovaro.quamber.qmd"
# Like systemd, systemd-socket-activate gives the daemon a clean environment
# and only the variables it is told to pass.
passed=()
for variable in QM_DUCT_DIR QM_IDLE_EXIT QM_LOG_STDERR XDG_DATA_HOME XDG_CONFIG_HOME XDG_STATE_HOME \
                QM_SYSTEM_ROOTS QM_SDK_PATH ASAN_OPTIONS UBSAN_OPTIONS; do
    [ -z "${!variable:-}" ] || passed+=(-E "$variable")
done
(
    while true; do
        systemd-socket-activate "${passed[@]}" -l "$socket" "$prefix/bin/qmd" &
        echo $! >"$tmp/activate.pid"
        wait $! || true
    done
) >>"$tmp/qmd.log" 2>&1 &
launcher_pid=$!

# A client may connect while the socket listens: the launcher waits on it,
# or qmd serves it ("Listening on" once per round, one idle exit per round).
rounds_started() { at_least "Listening on" "$1"; }
qmkit() { "$prefix/bin/qmkit" --timeout 20 "$@"; }

eventually rounds_started 1 || fail "systemd-socket-activate did not listen"
qmkit bulk >/dev/null || fail "qmkit bulk through the activated socket"
at_least "Execing $prefix/bin/qmd" 1 || fail "qmd was not started by the first connection"
matches=$("$tmp/qmclient-example" ovaro.share-services) || fail "the example client failed"
[ "$matches" = "ovaro.example.notes.share	$top/examples/Applications/Notes.app/PlugIns/ShareToNotes.bundle" ] ||
    fail "the example client printed: $matches"

eventually at_least "idle for 2 seconds: exiting" 1 || fail "qmd did not exit when idle"
eventually rounds_started 2 || fail "the socket was not listened on again"
qmkit --json send '{"request": "bulk"}' >/dev/null || fail "qmkit after the idle exit"
at_least "Execing $prefix/bin/qmd" 2 || fail "qmd was not started again by the next connection"
eventually at_least "idle for 2 seconds: exiting" 2 || fail "qmd did not exit when idle the second time"

stop_launcher
echo "install test passed"
