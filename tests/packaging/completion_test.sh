#!/usr/bin/env bash
# The bash completion offers what memspread and vmsnap accept: the --sort columns and -f formats
# that the binary itself lists, every option of each usage, running processes by name (also one
# with a space in its name) and by pid, and files where a file is expected.
# Usage: completion_test.sh MEMSPREAD_BINARY COMPLETION_SCRIPT VMSNAP_BINARY
set -uo pipefail
binary=$1
script=$2
vmsnap=$3
failures=0

source /usr/share/bash-completion/bash_completion || exit 1
source "$script" || exit 1

fail() {
    echo "FAIL: $*" >&2
    failures=$((failures + 1))
}

# complete LINE: the completions bash offers at the end of LINE, sorted, one a line. Words are
# separated by single spaces; a backslash before a space keeps it in the word, as in the shell.
complete_line() {
    local line=$1
    COMP_LINE=$line
    COMP_POINT=${#line}
    COMP_WORDS=()
    local word
    while IFS= read -r -d ' ' word; do COMP_WORDS+=("${word//$'\x01'/\\ }"); done <<<"${line//\\ /$'\x01'} "
    COMP_CWORD=$((${#COMP_WORDS[@]} - 1))
    COMPREPLY=()
    "_${COMP_WORDS[0]}"
    printf '%s\n' "${COMPREPLY[@]}" | sort
}

# expect_same DESCRIPTION EXPECTED ACTUAL
expect_same() {
    [[ $2 == "$3" ]] || fail "$1: expected [${2//$'\n'/ }], got [${3//$'\n'/ }]"
}

# expect_offered LINE WORD: WORD is among the completions of LINE.
expect_offered() {
    complete_line "$1" | grep -qxF -- "$2" || fail "'$1' does not offer '$2': $(complete_line "$1" | tr '\n' ' ')"
}

# The sort columns and formats as the binary's own messages list them.
columns=$("$binary" --sort nonsense 2>&1 >/dev/null | sed -n 's/^Accepted arguments: //p' | tr -d ' ' | tr ',' '\n' | sort)
formats=$("$binary" -f nonsense 2>&1 >/dev/null | sed -n "s/^Accepted arguments: //p" | tr -d " '." | tr ',' '\n' | sort)
[[ $(wc -l <<<"$columns") -eq 7 && $(wc -l <<<"$formats") -eq 3 ]] || fail "cannot read the columns and formats from $binary"
expect_same "--sort" "$columns" "$(complete_line 'memspread --sort ')"
expect_same "--sort=" "$columns" "$(complete_line 'memspread --sort=')"
expect_same "-f" "$formats" "$(complete_line 'memspread -f ')"
expect_same "--sort re" "$(grep '^re' <<<"$columns")" "$(complete_line 'memspread --sort re')"

# Every option of the usage texts.
for option in $("$binary" -h | grep -oE -- '(^|[ ,])--?[A-Za-z]+' | tr -d ' ,' | sort -u); do
    expect_offered 'memspread -' "$option"
done
vmsnap_options=$("$vmsnap" -h | grep -oE -- '(^|[ ,])--?[A-Za-z]+' | tr -d ' ,' | sort -u)
[[ $(wc -l <<<"$vmsnap_options") -ge 6 ]] || fail "cannot read the options of $vmsnap"
for option in $vmsnap_options; do
    expect_offered 'vmsnap -' "$option"
done

# A running process by name, quoted for the shell, and by pid, as a target and after -x; a
# partial name matches only by its beginning.
work=$(mktemp -d)
trap 'kill "$pid" 2>/dev/null; wait "$pid" 2>/dev/null; rm -rf "$work"' EXIT
name="memspread completion $$"
cp "$(command -v sleep)" "$work/$name"
"$work/$name" 60 &
pid=$!
for _ in $(seq 50); do [[ $(readlink "/proc/$pid/exe" 2>/dev/null) == "$work/$name" ]] && break; sleep 0.1; done
quoted=$(printf '%q' "$name")
expect_offered 'memspread memspread\ compl' "$quoted"
expect_offered 'memspread -x memspread' "$quoted"
expect_offered "memspread $pid" "$pid"
expect_offered "memspread --pid ${pid:0:1}" "$pid"
[[ -z $(complete_line 'memspread completion') ]] || fail "a name matched in its middle"
# Kernel threads cannot be measured: kthreadd, where this system shows it, is not offered.
if [[ $(cat /proc/2/comm 2>/dev/null) == kthreadd ]]; then
    complete_line 'memspread 2' | grep -qx 2 && fail "the kernel thread 2 is offered"
    complete_line 'memspread kthread' | grep -q . && fail "the kernel thread kthreadd is offered"
fi
[[ -z $(complete_line 'memspread --pid memspread') ]] || fail "--pid offered names"
# vmsnap saves the same processes, but not the kernel.
expect_offered 'vmsnap memspread\ compl' "$quoted"
expect_offered "vmsnap $pid" "$pid"
complete_line 'vmsnap 0' | grep -qx 0 && fail "vmsnap offers the kernel's pid"
complete_line 'vmsnap kern' | grep -qx kernel && fail "vmsnap offers the kernel"

# Files for -j and for a target that looks like a path.
touch "$work/report.json"
expect_offered "memspread -j $work/rep" "$work/report.json"
expect_offered "memspread --metrilog=$work/rep" "$work/report.json"
expect_offered "memspread $work/rep" "$work/report.json"
expect_offered "vmsnap -o $work/rep" "$work/report.json"
[[ -z $(complete_line "vmsnap $work/rep") ]] || fail "vmsnap offered a file as a target"

exit $((failures > 0))
