#!/usr/bin/env bash
# Builds the benchmark programs in Release (build/bench), runs every one, and
# prints a table to standard output: for each operation our time through the
# public API, the floor (the same statements on raw SQLite, each prepared once
# and reused, measured in the same run), their ratio, and the floor with every
# statement prepared anew (what the store does by rule); then the peak
# resident memory of each program and of a resend of 100 000 queued deltas.
# Figures are medians over the repetitions. Takes a few minutes.
#
#   scripts/bench.sh
#   BENCH_REPETITIONS=9 scripts/bench.sh      more repetitions (default 5)
#   TMPDIR=/some/disk scripts/bench.sh        where the databases are made
#
# Raw results (Google Benchmark JSON and console logs) stay in
# build/bench/results.
set -euo pipefail
source "$(dirname "${BASH_SOURCE[0]}")/common.sh"
"$repo_root/scripts/setup.sh"

repetitions="${BENCH_REPETITIONS:-5}"
build="$build_root/bench"
results="$build/results"

configure_build bench -DCMAKE_BUILD_TYPE=Release -DTESSARINE_WERROR=ON -DTESSARINE_BUILD_BENCHMARKS=ON \
  -DTESSARINE_BUILD_TESTS=OFF -DTESSARINE_BUILD_EXAMPLES=OFF
cmake --build "$build" >/dev/null
rm -rf "$results"
mkdir -p "$results"

# run LABEL PROGRAM [benchmark options...]: one process, its JSON and log.
run() {
  local label="$1" program="$2"; shift 2
  echo "running $label" >&2
  "$build/bench/$program" \
    --benchmark_repetitions="$repetitions" \
    --benchmark_enable_random_interleaving=true \
    --benchmark_report_aggregates_only=true \
    --benchmark_min_time=0.2 \
    --benchmark_out="$results/$label.json" --benchmark_out_format=json \
    "$@" >"$results/$label.log"
}

run local_save local_save_bench
run remote_apply remote_apply_bench
run queries queries_bench
run resend resend_bench --benchmark_filter='^resend/'
run sync_metrics resend_bench --benchmark_filter='^sync_metrics/'
run scale scale_bench
# Networked sync through a mosquitto broker on loopback that the program starts.
run network network_bench
# The server tier: instances on SQLite and on a shared PostgreSQL that the
# program starts (initdb in a temporary folder), with a mosquitto broker.
run server_tier server_tier_bench
# The memory of one resend of 100 000 queued deltas, each side in a process of
# its own so that neither's peak hides the other's.
run resend_memory_ours resend_bench --benchmark_filter='^resend_memory/ours/100000' --benchmark_repetitions=1
run resend_memory_ours_small resend_bench --benchmark_filter='^resend_memory/ours/1000(/|$)' --benchmark_repetitions=1
run resend_memory_floor resend_bench --benchmark_filter='^resend_memory/floor/' --benchmark_repetitions=1
run resend_memory_floor_read_first resend_bench --benchmark_filter='^resend_memory/floor_read_first/' \
  --benchmark_repetitions=1

# Instruction counts: each operation once more, alone, under callgrind, which
# counts the instructions of the measured loop only (the programs switch
# collection on and off around it on their own thread) and everything the
# store's worker thread does (it runs jobs only for the measured operations).
# Unlike times, these do not depend on what else the machine is doing.
# BENCH_CALLGRIND=0 skips them.
# count LABEL PROGRAM BENCHMARK: one benchmark, its JSON and callgrind's log.
count() {
  local label="$1" program="$2" benchmark="$3"
  TESSARINE_BENCH_ITERATIONS="${BENCH_CALLGRIND_ITERATIONS:-200}" \
    valgrind --tool=callgrind --collect-atstart=no --callgrind-out-file=/dev/null \
    --toggle-collect='*SerializedJobQueue::retryUntilSucceeds*' \
    "$build/bench/$program" --benchmark_filter="^$benchmark(/|\$)" --benchmark_repetitions=1 \
    --benchmark_out="$results/callgrind/$label.json" --benchmark_out_format=json \
    >/dev/null 2>"$results/callgrind/$label.log"
}
if [ "${BENCH_CALLGRIND:-1}" != 0 ]; then
  mkdir -p "$results/callgrind"
  for side in ours floor; do
    echo "counting instructions, $side" >&2
    count "local_save_$side" local_save_bench "local_save/$side"
    count "remote_apply_$side" remote_apply_bench "remote_apply/$side"
    for query in range_query get_object indexed_query indexed_sorted_query; do
      count "${query}_$side" queries_bench "$query/$side"
    done
    count "resend_$side" resend_bench "resend/$side"
  done
fi

python3 "$repo_root/scripts/bench_table.py" "$results"
