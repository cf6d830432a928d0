#!/usr/bin/env bash
# Builds the libFuzzer targets of fuzz/ (clang, ASan, UBSan, leak checks) and runs each for a
# bounded time from its seeds in fuzz/corpus/<name>/. Fails on a crash, a leak, a time-out or an
# out-of-memory in any target; findings are left in BUILD_DIR/findings/.
# Usage: fuzz.sh [SECONDS_PER_TARGET] [BUILD_DIR]    (defaults: 60, build-fuzz)
set -euo pipefail
cd "$(dirname "$0")/.."
seconds=${1:-60}
build=${2:-build-fuzz}
CC=clang CXX=clang++ cmake -S . -B "$build" -DORVANE_FUZZ=ON >/dev/null
cmake --build "$build" -j "$(nproc)"
mkdir -p "$build/findings"
status=0
for source in fuzz/*_fuzzer.cpp; do
    name=$(basename "$source" .cpp)
    corpus="$build/corpus/$name"  # grows as the search finds new paths; the seeds stay as they are
    mkdir -p "$corpus"
    seeds=()
    [ -d "fuzz/corpus/${name%_fuzzer}" ] && seeds=("fuzz/corpus/${name%_fuzzer}")
    log="$build/findings/$name.log"
    if "$build/$name" -max_total_time="$seconds" -timeout=10 -rss_limit_mb=2048 -max_len=70000 \
        -print_final_stats=1 -artifact_prefix="$build/findings/$name-" "$corpus" "${seeds[@]}" >"$log" 2>&1; then
        runs=$(grep -m1 'stat::number_of_executed_units' "$log" | awk '{print $2}')
        echo "fuzz: $name ${seconds}s ${runs:-?} runs, no finding"
    else
        echo "fuzz: $name FAILED, see $log"
        grep -E "ERROR|SUMMARY|Test unit written" "$log" | head -5
        status=1
    fi
done
exit $status
