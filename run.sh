#!/usr/bin/env bash
# Builds memspread if needed and runs it. Arguments go to memspread; with none it measures every
# process when run as root, else the calling shell and its children.
set -euo pipefail
memspread_root=$(cd "$(dirname "${BASH_SOURCE[0]}")" && pwd)
source "$memspread_root/tools/common.sh"

install_missing_packages
build_tree "$memspread_root/build" -DMEMSPREAD_TESTS=OFF >&2

binary="$memspread_root/build/src/memspread"
if [ $# -gt 0 ]; then
    exec "$binary" "$@"
elif [ "$(id -u)" -eq 0 ]; then
    exec "$binary" -a
else
    exec "$binary" -t "$PPID"
fi
