# Shared by test.sh and tools/fuzz.sh: the libFuzzer build of the parsers and its runs.
# Needs tools/common.sh sourced first (memspread_root, build_tree).

# build_fuzzers DIR: configures DIR with clang and builds every fuzz target (tests/fuzz).
build_fuzzers() {
    local dir=$1
    CC=clang CXX=clang++ cmake -S "$memspread_root" -B "$dir" -DCMAKE_BUILD_TYPE=RelWithDebInfo \
        -DMEMSPREAD_FUZZ=ON -DMEMSPREAD_TESTS=OFF >/dev/null
    cmake --build "$dir" -j "$(nproc)" --target fuzz_targets
}

# run_fuzzers DIR SECONDS [TARGET...]: runs each fuzz target (all of them by default) for SECONDS
# from its seed corpus; new inputs go to a scratch corpus beside it, crashes to DIR/crashes.
# Prints executions and coverage per target; fails when a target crashed.
run_fuzzers() {
    local dir=$1 seconds=$2
    shift 2
    local fuzz_dir="$dir/tests/fuzz" targets=("$@") failed=0
    if [ ${#targets[@]} -eq 0 ]; then
        for binary in "$fuzz_dir"/fuzz_*; do targets+=("$(basename "$binary" | sed 's/^fuzz_//')"); done
    fi
    mkdir -p "$dir/crashes"
    for target in "${targets[@]}"; do
        local scratch="$dir/scratch-corpus/$target" log="$dir/fuzz-$target.log"
        mkdir -p "$scratch"
        # Twice the time as a hard bound: libFuzzer stops itself at max_total_time.
        if timeout $((seconds * 2 + 60)) "$fuzz_dir/fuzz_$target" -max_total_time="$seconds" -print_final_stats=1 \
            -artifact_prefix="$dir/crashes/$target-" "$scratch" "$fuzz_dir/corpus/$target" >"$log" 2>&1; then
            local runs cov
            runs=$(sed -n 's/^stat::number_of_executed_units: *//p' "$log")
            cov=$(grep -o 'cov: [0-9]*' "$log" | tail -1)
            echo "fuzz_$target: $runs executions, $cov, no crash"
        else
            echo "fuzz_$target FAILED: see $log" >&2
            tail -30 "$log" >&2
            failed=1
        fi
    done
    return $failed
}
