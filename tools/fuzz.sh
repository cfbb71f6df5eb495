#!/usr/bin/env bash
# Fuzzes the parsers: tools/fuzz.sh [SECONDS [TARGET...]] builds the libFuzzer targets in
# build-fuzz and runs each for SECONDS (default 1800). Crashes land in build-fuzz/crashes.
set -euo pipefail
memspread_root=$(cd "$(dirname "${BASH_SOURCE[0]}")/.." && pwd)
source "$memspread_root/tools/common.sh"
source "$memspread_root/tools/fuzzing.sh"

seconds=${1:-1800}
[ $# -gt 0 ] && shift
install_missing_packages
build_fuzzers "$memspread_root/build-fuzz"
run_fuzzers "$memspread_root/build-fuzz" "$seconds" "$@"
