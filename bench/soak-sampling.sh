#!/usr/bin/env bash
# Soak of sampling mode: runs `memspread --sample 0.1 -a` (as root) for a while and records
# memspread's own resident memory, open descriptors and threads at two points, to show that
# sampling does not grow. Not a test: it takes half an hour and its figures depend on the machine.
#
#   bench/soak-sampling.sh [BINARY] [OUTPUT_DIR]
#
# Environment: SOAK_EARLY (seconds to the first reading, default 300), SOAK_TOTAL (seconds to
# the last, default 1800), SOAK_NICE (memspread's niceness, default 0). The report goes to
# OUTPUT_DIR/soak.txt (default: a new temporary directory); the samples themselves are
# discarded. On a machine busy with other work a high niceness starves the analysis thread
# (niceness + 5), the interval grows far past 0.1 s and never shrinks, and the late reading
# then shows memspread mostly at rest: keep the default unless the machine is idle.
set -euo pipefail

binary=${1:-build/src/memspread}
out=${2:-$(mktemp -d /tmp/memspread-soak.XXXXXX)}
early=${SOAK_EARLY:-300}
niceness=${SOAK_NICE:-0}
total=${SOAK_TOTAL:-1800}
mkdir -p "$out"
report="$out/soak.txt"

[[ $(id -u) == 0 ]] || { echo "soak-sampling: -a needs root" >&2; exit 1; }
[[ -x $binary ]] || { echo "soak-sampling: no binary at $binary" >&2; exit 1; }

# One line of figures for the running memspread, over twenty readings a quarter of a second
# apart: descriptors and memory swing with the sample in flight (it holds one descriptor per
# measured process), so the lowest value is memspread at rest and the highest one with a sample.
range() { sort -n | awk 'NR == 1 {lo = $1} {hi = $1} END {print lo ".." hi}'; }
reading() {
    local label=$1 pid=$2 rss=() threads=() fds=() procs=() hwm=
    for _ in $(seq 20); do
        rss+=("$(awk '/^VmRSS:/ {print $2}' "/proc/$pid/status")")
        hwm=$(awk '/^VmHWM:/ {print $2}' "/proc/$pid/status")
        threads+=("$(awk '/^Threads:/ {print $2}' "/proc/$pid/status")")
        fds+=("$(ls "/proc/$pid/fd" | wc -l)")
        procs+=("$(compgen -G "/proc/[0-9]*" | wc -l)")
        sleep 0.25
    done
    printf '%-6s t=%-6s rss_kb=%-18s hwm_kb=%-9s fds=%-10s threads=%-6s processes=%s\n' "$label" \
        "$(( $(date +%s) - started ))s" "$(printf '%s\n' "${rss[@]}" | range)" "$hwm" \
        "$(printf '%s\n' "${fds[@]}" | range)" "$(printf '%s\n' "${threads[@]}" | range)" \
        "$(printf '%s\n' "${procs[@]}" | range)" | tee -a "$report"
}

{
    echo "memspread sampling soak: $binary --sample 0.1 -a, $(date -u '+%F %T') UTC"
    echo "machine: $(nproc) CPUs, $(awk '/MemTotal/ {print $2}' /proc/meminfo) kB, $(ls -d /proc/[0-9]* | wc -l) processes"
} > "$report"

started=$(date +%s)
nice -n "$niceness" "$binary" --sample 0.1 -a > /dev/null 2> "$out/stderr.txt" &
pid=$!
trap 'kill -INT $pid 2>/dev/null || true' EXIT

sleep 10
reading "start" "$pid"
sleep $(( early - 20 ))
reading "early" "$pid"
sleep $(( total - early - 5 ))
reading "late" "$pid"

kill -INT "$pid"
status=0
wait "$pid" || status=$?
trap - EXIT
{
    echo "exit status after SIGINT: $status"
    echo "interval warnings: $(grep -c '^WARNING' "$out/stderr.txt" || true)"
    grep '^WARNING' "$out/stderr.txt" | tail -n 1 || true
    # Rest and peak figures of the late reading against the early one.
    awk '/^(early|late) / {
             for (i = 3; i <= NF; i++) {
                 split($i, kv, "="); if (split(kv[2], r, /\.\./) < 2) r[2] = r[1]
                 if (kv[1] == "processes") continue
                 if ($1 == "early") {lo[kv[1]] = r[1]; hi[kv[1]] = r[2]}
                 else if (lo[kv[1]] > 0 && hi[kv[1]] > 0)
                     printf "%s late/early: at rest %.3f, peak %.3f\n", kv[1], r[1] / lo[kv[1]], r[2] / hi[kv[1]]
             }
         }' "$report"
} | tee -a "$report"
echo "report: $report"
