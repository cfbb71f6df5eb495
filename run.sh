#!/usr/bin/env bash
# Builds memspread if needed and runs it. Arguments go to memspread; with none it measures every
# process when run as root, else the calling shell and its children.
set -euo pipefail
memspread_root=$(cd "$(dirname "${BASH_SOURCE[0]}")" && pwd)
source "$memspread_root/tools/common.sh"

install_missing_packages
# The build speaks only when it fails, so that memspread's own output stands alone.
build_log="$memspread_root/build/run-build.log"
mkdir -p "$memspread_root/build"
if ! build_tree "$memspread_root/build" -DMEMSPREAD_TESTS=OFF >"$build_log" 2>&1; then
    cat "$build_log" >&2
    echo "run.sh: the build failed (log: $build_log)" >&2
    exit 1
fi

binary="$memspread_root/build/src/memspread"
if [ $# -gt 0 ]; then
    exec "$binary" "$@"
elif [ "$(id -u)" -eq 0 ]; then
    exec "$binary" -a
else
    exec "$binary" -t "$PPID"
fi
