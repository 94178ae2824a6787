#!/usr/bin/env bash
# Checks the bash completion against the tool it completes: the commands it offers are those
# that `tavix_tool --help` lists, and it completes the words that follow a command.
# usage: completion_test.sh COMPLETION_FILE TAVIX_TOOL
set -u
completion=$1
tool=$2
failures=0

source /usr/share/bash-completion/bash_completion || { echo "bash-completion is not installed"; exit 1; }
source "$completion"

# Completes the command line "$@" (the last word is the one being typed).
complete_line() {
    COMP_WORDS=("$tool" "$@")
    COMP_CWORD=$((${#COMP_WORDS[@]} - 1))
    COMP_LINE="${COMP_WORDS[*]}"
    COMP_POINT=${#COMP_LINE}
    COMPREPLY=()
    _tavix_tool
    printf '%s\n' "${COMPREPLY[@]}" | sort | tr '\n' ' '
}

expect() {
    local want=$1 got=$2 what=$3
    if [[ "$got" != "$want" ]]; then
        echo "FAIL $what: expected '$want', got '$got'"
        failures=$((failures + 1))
    fi
}

help_commands=$("$tool" --help | sed -n 's/^  \([a-z][a-z-]*\) .*/\1/p; s/^  \([a-z][a-z-]*\)$/\1/p' | sort -u | tr '\n' ' ')
[[ -n "$help_commands" ]] || { echo "FAIL: tavix_tool --help lists no command"; exit 1; }
offered=$(complete_line "" | tr ' ' '\n' | grep -v '^--' | grep -v '^$' | sort -u | tr '\n' ' ')
expect "$help_commands" "$offered" "the commands"

expect "write " "$(complete_line defaults wr)" "defaults verbs"
expect "com.norvel.tavixd.dp.flush com.norvel.tavixd.flusher.background " "$(complete_line activity run com)" \
    "activity names"
expect "run " "$(complete_line --socket /tmp/x activity "")" "a command after --socket"
expect "--trigger " "$(complete_line search --t)" "search options"
expect "--inflate " "$(complete_line watch-uploads --)" "watch-uploads options"

if ((failures > 0)); then
    echo "$failures failed"
    exit 1
fi
echo "completion matches tavix_tool"
