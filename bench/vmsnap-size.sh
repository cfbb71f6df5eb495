#!/usr/bin/env bash
# Size and time of a capture of every process: vmsnap -a against the smaps text it replaces,
# and the analysis of the capture against a live run. Needs root and a built tree.
#   bench/vmsnap-size.sh [BUILD_DIR]   (default: build)
set -euo pipefail
root=$(cd "$(dirname "${BASH_SOURCE[0]}")/.." && pwd)
build=${1:-$root/build}
vmsnap=$build/src/vmsnap
memspread=$build/src/memspread
[ "$(id -u)" -eq 0 ] || { echo "needs root" >&2; exit 1; }
capture=$(mktemp -d)
trap 'rm -rf "$capture"' EXIT

start=$(date +%s.%N)
"$vmsnap" -a -o "$capture" >/dev/null 2>&1 || true
captured=$(date +%s.%N)
smaps=$( (cat /proc/[0-9]*/smaps 2>/dev/null || true) | wc -c)
files=$(find "$capture" -name '*.vmsnap' | wc -l)
bytes=$(du -sb "$capture" | cut -f1)
analysed_start=$(date +%s.%N)
"$memspread" "$capture"/*.vmsnap >/dev/null 2>&1
analysed=$(date +%s.%N)
"$memspread" -a >/dev/null 2>&1
live=$(date +%s.%N)

echo "processes saved:     $files"
echo "snapshots:           $bytes bytes"
echo "smaps text:          $smaps bytes (1/$((smaps / (bytes > 0 ? bytes : 1))) of it)"
seconds() { python3 -c "print('%.2f s' % ($2 - $1))"; }
echo "vmsnap -a:           $(seconds "$start" "$captured")"
echo "memspread capture/*: $(seconds "$analysed_start" "$analysed")"
echo "memspread -a:        $(seconds "$analysed" "$live")"
