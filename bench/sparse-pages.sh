#!/usr/bin/env bash
# What reading a process with a sparse terabyte costs: memspread's peak memory and CPU on the
# sparse load (bench/sparse-load.cc: 1 TiB private and 1 TiB shared anonymous, a few pages
# written, forked), against the floor of reading the pair's smaps once.
#
# Usage: bench/sparse-pages.sh BUILD_DIR [RUNS]
set -euo pipefail
build=${1:?usage: bench/sparse-pages.sh BUILD_DIR [RUNS]}
runs=${2:-3}
memspread=$build/src/memspread
scratch=$(mktemp -d)
trap 'exec 3>&- 2>/dev/null || true; wait 2>/dev/null || true; rm -rf "$scratch"' EXIT
fixture=$scratch/sparse-load
c++ -O2 -std=c++20 -Wall -o "$fixture" "$(dirname "${BASH_SOURCE[0]}")/sparse-load.cc"

# The fixture lives until its standard input closes: fd 3 holds the pipe open.
exec 3> >("$fixture" >"$scratch/fixture")
until grep -q '^ready' "$scratch/fixture" 2>/dev/null; do sleep 0.1; done
parent=$(pgrep -n -f "^$fixture")
child=$(sed -n 's/^child //p' "$scratch/fixture")

measure() {  # prints "peak-kB cpu-seconds" of one command
    /usr/bin/time -f '%M %U %S' -o "$scratch/time" "$@" >/dev/null 2>&1
    awk '{ printf "%d %.3f\n", $1, $2 + $3 }' "$scratch/time"
}
echo "run  floor(kB s)      memspread(kB s)"
for ((i = 1; i <= runs; i++)); do
    floor=$(measure cat "/proc/$parent/smaps" "/proc/$child/smaps")
    ours=$(measure "$memspread" -f bytes "$parent" "$child")
    echo "$i    $floor    $ours"
done
