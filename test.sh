#!/usr/bin/env bash
# Installs what is missing, builds, and runs every test twice: a normal build, then a build under
# AddressSanitizer and UndefinedBehaviorSanitizer; then the gathering and sampling tests under
# ThreadSanitizer, and a short run of every parser's fuzzer. The normal build is also installed
# and packaged.
set -euo pipefail
memspread_root=$(cd "$(dirname "${BASH_SOURCE[0]}")" && pwd)
source "$memspread_root/tools/common.sh"
source "$memspread_root/tools/package.sh"
source "$memspread_root/tools/fuzzing.sh"

install_missing_packages

run_suite() {
    local dir=$1
    shift
    build_tree "$dir" -DMEMSPREAD_TESTS=ON -DMEMSPREAD_WERROR=ON "$@"
    (cd "$dir" && ctest --output-on-failure -j 2 --timeout 600)
}

# The tests whose threads meet: gathering (worker pool, cancel, the names workers intern),
# sampling (timer, analysis queue), and the end-to-end runs of -a, whose binary is then built
# under ThreadSanitizer too.
# Picked by name, so that tests named so join by themselves.
tsan_test_binaries=(model_tests analysis_tests driver_tests e2e_tests)
tsan_test_names='Gather|Cancel|Sampl|RKAllProcesses.EveryProcess|UnderAll'

run_tsan_suite() {
    local dir=$1
    cmake -S "$memspread_root" -B "$dir" -DCMAKE_BUILD_TYPE=RelWithDebInfo -DMEMSPREAD_TESTS=ON \
        -DMEMSPREAD_WERROR=ON -DMEMSPREAD_TSAN=ON >/dev/null
    cmake --build "$dir" -j "$(nproc)" --target "${tsan_test_binaries[@]}"
    (cd "$dir" && TSAN_OPTIONS=halt_on_error=1:second_deadlock_stack=1 \
        ctest --output-on-failure -j 2 --timeout 600 -R "$tsan_test_names")
}

# Ten seconds of each parser's fuzzer: a crash on the corpus or soon after fails the build. The
# long runs are tools/fuzz.sh.
run_fuzz_smoke() {
    local dir=$1
    build_fuzzers "$dir"
    run_fuzzers "$dir" 10
}

echo "== normal build"
run_suite "$memspread_root/build-test"
echo "== install and Debian package"
check_install_and_package "$memspread_root/build-test"
echo "== AddressSanitizer + UndefinedBehaviorSanitizer build"
ASAN_OPTIONS=detect_leaks=1:abort_on_error=1 UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1 \
    run_suite "$memspread_root/build-sanitize" -DMEMSPREAD_SANITIZE=ON
echo "== ThreadSanitizer build of the gathering and sampling tests"
run_tsan_suite "$memspread_root/build-tsan"
echo "== fuzzers (clang, libFuzzer): a short run of each"
run_fuzz_smoke "$memspread_root/build-fuzz"
