#!/usr/bin/env bash
# memspread against the floor of reading smaps, on a load of many processes and mappings.
# For each load: build it (bench/scale-load.c), then run in turn, REPS times round:
#   floor1  bench/smaps-floor.c, 1 thread: reads every /proc/PID/smaps whole, nothing else
#   floor2  the same with 2 threads
#   floorm  floor2 and the pagemap of the mappings with shared anonymous pages (smaps-floor -m):
#           the kernel's own cost of the page data the fork-shared pass reads
#   memspread  `memspread -a -j FILE` (text to a file too), page data and fork-shared pass
# and print the median wall time and peak resident memory (/usr/bin/time's maxrss) of each,
# with memspread's ratios to the floors. Ratios are what to compare: the machine may be shared.
#
#   bench/scale.sh [-b BINARY]... [-o] [-r REPS] [-x GIB] [LOAD...]       (as root)
#
# Several -b run in turn on the same load (before and after a change), one row each, numbered
# from 0. -o adds a row for each binary run with MEMSPREAD_FORK_SHARING=off (no fork-shared
# pass), numbered with an "o".
#
# LOAD is CHILDREN:MAPPINGS:MIB (the parent writes MAPPINGS 64 KiB mappings and MIB MiB, then
# forks CHILDREN times), default 200:1000:16 400:1000:16 800:1000:16 (half, 1x, double).
# A load of 0 children, e.g. 0:60000:0, is measured against its own smaps only:
# `smaps-floor 1 PID` and `memspread -p PID -j FILE`.
# -x GIB leaves out of both the floor and memspread (`-x PID`) the processes of more than GIB GiB
# of address space: sanitizer builds reserve terabytes, and another user's fuzzer running on a
# shared machine would otherwise decide the figures.
set -euo pipefail

here=$(cd "$(dirname "$0")" && pwd)
binaries=()
reps=3
huge=0
pass_off=0
while getopts b:or:x: option; do
    case $option in
        b) binaries+=("$OPTARG") ;;
        o) pass_off=1 ;;
        r) reps=$OPTARG ;;
        x) huge=$OPTARG ;;
        *) exit 2 ;;
    esac
done
shift $((OPTIND - 1))
loads=("$@")
((${#loads[@]})) || loads=(200:1000:16 400:1000:16 800:1000:16)

[[ $(id -u) == 0 ]] || { echo "scale.sh: run as root (page data and every process)" >&2; exit 1; }
((${#binaries[@]})) || binaries=("$here/../build-rel/src/memspread")
for binary in "${binaries[@]}"; do
    [[ -x $binary ]] || { echo "scale.sh: no memspread at $binary" >&2; exit 1; }
done
# The rows: a label and the fork-sharing setting of each run of a binary.
rows=()
for b in "${!binaries[@]}"; do
    rows+=("$b:on")
    ((pass_off)) && rows+=("${b}o:off")
done
[[ -x /usr/bin/time ]] || { echo "scale.sh: needs /usr/bin/time (Debian package time)" >&2; exit 1; }

work=$(mktemp -d /tmp/memspread-scale.XXXXXX)
load_pid=
stop_load() {
    if [[ -n $load_pid ]]; then
        kill -TERM "$load_pid" 2>/dev/null || true
        wait "$load_pid" 2>/dev/null || true
        load_pid=
    fi
}
cleanup() {
    stop_load
    exec 4>&- 2>/dev/null || true
    rm -rf "$work"
}
trap cleanup EXIT
trap 'exit 130' INT TERM HUP

cc -O2 -Wall -o "$work/scale-load" "$here/scale-load.c"
cc -O2 -Wall -pthread -o "$work/smaps-floor" "$here/smaps-floor.c"

# The load reads a pipe that only this script holds open for writing: if the script dies
# without running its trap, the pipe closes and the load stops on its own.
mkfifo "$work/hold"

start_load() {  # CHILDREN MAPPINGS MIB
    "$work/scale-load" "$@" < "$work/hold" > "$work/ready" &
    load_pid=$!
    exec 4> "$work/hold"
    until grep -q '^ready' "$work/ready" 2>/dev/null; do
        kill -0 "$load_pid" 2>/dev/null || { echo "scale.sh: the load failed" >&2; exit 1; }
        sleep 0.2
    done
}

# One timed run: appends "SECONDS MAXRSS_KB" to $work/NAME.
timed() {  # NAME COMMAND...
    local name=$1
    shift
    /usr/bin/time -f '%e %M' -o "$work/time" "$@" > "$work/out" 2> "$work/err" 4>&- ||
        { echo "scale.sh: $name failed:" >&2; cat "$work/err" >&2; exit 1; }
    cat "$work/time" >> "$work/$name"
}

median() {  # FILE COLUMN
    awk -v c="$2" '{print $c}' "$1" | sort -g | awk '{v[NR] = $1} END {print (NR % 2) ? v[(NR + 1) / 2] : (v[NR / 2] + v[NR / 2 + 1]) / 2}'
}

printf '%s, %s CPUs, load average %s, memspread %s, %s runs each (medians)\n' "$(date -u '+%F %T UTC')" \
    "$(nproc)" "$(cut -d' ' -f1-3 /proc/loadavg)" "${binaries[*]}" "$reps"
printf '%-3s %-14s %9s %9s | %8s %8s %8s %8s | %8s %8s %8s | %9s %9s %9s\n' bin load processes mappings \
    floor1_s floor2_s floorm_s mspread_s /floor1 /floor2 /floorm floor_MiB mspr_MiB B/region

for load in "${loads[@]}"; do
    IFS=: read -r children mappings mib <<< "$load"
    start_load "$children" "$mappings" "$mib"
    parent=$(awk '/^ready/ {print $2}' "$work/ready")
    rm -f "$work"/floor1 "$work"/floor2 "$work"/floorm "$work"/memspread*
    if ((children == 0)); then
        targets=("$parent")
        selection=(-p "$parent")
    elif ((huge > 0)); then
        # Chosen once per load: the same processes for every run.
        targets=()
        selection=(-a)
        while read -r pid vsz; do
            if ((vsz > huge * 1024 * 1024)); then selection+=(-x "$pid"); else targets+=("$pid"); fi
        done < <(ps -e -o pid= -o vsz=)
    else
        targets=()
        selection=(-a)
    fi
    if ((${#targets[@]})); then
        processes=${#targets[@]}
        regions=$( (cd /proc && cat "${targets[@]/%//maps}" 2>/dev/null || true) | wc -l)
    else
        processes=$(ls -d /proc/[0-9]* | wc -l)
        regions=$({ cat /proc/[0-9]*/maps 2>/dev/null || true; } | wc -l)
    fi
    for ((i = 0; i < reps; i++)); do
        timed floor1 "$work/smaps-floor" 1 "${targets[@]}"
        timed floor2 "$work/smaps-floor" 2 "${targets[@]}"
        timed floorm "$work/smaps-floor" -m 2 "${targets[@]}"
        for row in "${rows[@]}"; do
            label=${row%%:*}
            timed "memspread$label" env MEMSPREAD_FORK_SHARING="${row#*:}" \
                sh -c "exec \"\$0\" \"\$@\" > '$work/out.txt'" "${binaries[${label%o}]}" "${selection[@]}" \
                -j "$work/out.json"
        done
    done
    stop_load
    exec 4>&-

    f1=$(median "$work/floor1" 1)
    f2=$(median "$work/floor2" 1)
    fm=$(median "$work/floorm" 1)
    frss=$(median "$work/floor2" 2)
    for row in "${rows[@]}"; do
        b=${row%%:*}
        m=$(median "$work/memspread$b" 1)
        mrss=$(median "$work/memspread$b" 2)
        awk -v b="$b" -v load="$load" -v p="$processes" -v r="$regions" -v f1="$f1" -v f2="$f2" -v fm="$fm" \
            -v m="$m" -v frss="$frss" -v mrss="$mrss" 'BEGIN {
            printf "%-3s %-14s %9d %9d | %8.2f %8.2f %8.2f %8.2f | %8.2f %8.2f %8.2f | %9.1f %9.1f %9.0f\n",
                b, load, p, r, f1, f2, fm, m, (f1 > 0 ? m / f1 : 0), (f2 > 0 ? m / f2 : 0), (fm > 0 ? m / fm : 0),
                frss / 1024, mrss / 1024, mrss * 1024 / r }'
    done
done
