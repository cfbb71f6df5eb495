#!/usr/bin/env bash
# Installs what is missing, builds, and runs every test twice: a normal build, then a build under
# AddressSanitizer and UndefinedBehaviorSanitizer. The normal build is also installed and packaged.
set -euo pipefail
memspread_root=$(cd "$(dirname "${BASH_SOURCE[0]}")" && pwd)
source "$memspread_root/tools/common.sh"
source "$memspread_root/tools/package.sh"

install_missing_packages

run_suite() {
    local dir=$1
    shift
    build_tree "$dir" -DMEMSPREAD_TESTS=ON -DMEMSPREAD_WERROR=ON "$@"
    (cd "$dir" && ctest --output-on-failure -j 2 --timeout 600)
}

echo "== normal build"
run_suite "$memspread_root/build-test"
echo "== install and Debian package"
check_install_and_package "$memspread_root/build-test"
echo "== AddressSanitizer + UndefinedBehaviorSanitizer build"
ASAN_OPTIONS=detect_leaks=1:abort_on_error=1 UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1 \
    run_suite "$memspread_root/build-sanitize" -DMEMSPREAD_SANITIZE=ON
