#!/usr/bin/env bash
# Checks that the man pages cover what the programs say they take:
#
#   man_coverage_test.sh BUILD-DIR
#
# - qmkit(1): every command `qmkit --help` lists has its own subsection, in
#   which every option of `qmkit COMMAND --help` appears; every global option
#   and exit status of `qmkit --help` appears;
# - qmd(8): every option and exit status of `qmd --help` appears, and every
#   environment variable the code reads (src/platform/env/Environment.cpp,
#   the one place that reads them) is under ENVIRONMENT.
set -u
here=$(cd "$(dirname "$0")" && pwd)
top=$(cd "$here/../.." && pwd)
build=$1
failures=0
fail() {
    echo "FAILED: $*"
    failures=$(( failures + 1 ))
}

# The text of a page's part, roff escapes for hyphens and fonts removed:
# from the line that is $2, or starts with $2 and a blank, to the next .SH
# (or .SS, when $3 is "ss").
part() {
    local page=$1 start=$2 stop=${3:-sh}
    awk -v start="$start" -v stop="$stop" '
        $0 == start || index($0, start " ") == 1 { inside = 1; print; next }
        inside && /^\.SH/ { exit }
        inside && stop == "ss" && /^\.SS/ { exit }
        inside { print }' "$page" | sed -e 's/\\-/-/g' -e 's/\\f[BIRP]//g' -e 's/\\(dq/"/g'
}
# The options a help text names: words starting with "-" after a blank or "[".
options_in() {
    grep -oE '(^|[ [])--?[A-Za-z][A-Za-z-]*' | tr -d ' [' | sort -u
}
has_word() {  # has_word TEXT WORD
    grep -qE "(^|[^A-Za-z0-9-])$(sed 's/[.-]/\\&/g' <<<"$2")([^A-Za-z0-9-]|$)" <<<"$1"
}

qmkit_page="$here/qmkit.1"
qmd_page="$here/qmd.8"

# --- qmkit
commands=$("$build/qmkit" --help | awk '/^commands:/ { listing = 1; next } listing && /^  [a-z]/ { print $1 }')
[[ -n $commands ]] || fail "qmkit --help lists no commands"
for command in $commands; do
    section=$(part "$qmkit_page" ".SS $command" ss)
    if [[ -z $section ]]; then
        fail "qmkit.1 has no subsection for the command $command"
        continue
    fi
    # The global options appear in every command's usage line; they are
    # checked under OPTIONS below.
    for option in $("$build/qmkit" "$command" --help | options_in | grep -vxE -- '-S|--json|--timeout'); do
        has_word "$section" "$option" || fail "qmkit.1 does not describe $option of 'qmkit $command'"
    done
done
inspect_json=$(part "$qmkit_page" ".SS inspect" ss)
has_word "$inspect_json" "--json" || fail "qmkit.1 does not describe inspect's own --json"
# Every word after the page file, named, in a section of the page.
described() {  # page-file page-name section what word...
    local text
    text=$(part "$1" "$3")
    local name=$2 section=$3 what=$4
    shift 4
    for word in "$@"; do
        if [[ $what == status ]]; then grep -qx "\.B $word" <<<"$text"; else has_word "$text" "$word"; fi ||
            fail "$name ${section#.SH } does not describe $word"
    done
}
# shellcheck disable=SC2046
described "$qmkit_page" qmkit.1 ".SH OPTIONS" option $("$build/qmkit" --help | options_in) -h
# shellcheck disable=SC2046
described "$qmkit_page" qmkit.1 ".SH EXIT STATUS" status \
    $("$build/qmkit" --help | sed -n '/^exit status/,$p' | grep -oE '(^|[ ,:])[0-9]+ ' | tr -d ' ,:')

# --- qmd
# shellcheck disable=SC2046
described "$qmd_page" qmd.8 ".SH OPTIONS" option $("$build/qmd" --help | options_in)
# shellcheck disable=SC2046
described "$qmd_page" qmd.8 ".SH EXIT STATUS" status \
    $("$build/qmd" --help | sed -n 's/^Exit status: //p' | grep -oE '(^| )[0-9]+ ' | tr -d ' ')
environment=$(part "$qmd_page" ".SH ENVIRONMENT")
variables=$(grep -oE '(variable|unsetenv)\("[A-Z_]+"\)|"(LANGUAGE|LC_ALL|LC_MESSAGES|LANG)"' \
                "$top/src/platform/env/Environment.cpp" | grep -oE '[A-Z_]{2,}' | sort -u)
[[ -n $variables ]] || fail "no environment variables found in Environment.cpp"
for variable in $variables; do
    has_word "$environment" "$variable" || fail "qmd.8 ENVIRONMENT does not describe $variable"
done

(( failures == 0 )) && echo "the man pages cover every command, option, exit status and variable"
exit $(( failures != 0 ))
