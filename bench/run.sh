#!/usr/bin/env bash
# Runs the benchmark program and prints the table of medians and ratios.
#
#   make bench                      # builds build/default, then runs this
#   ./bench/run.sh                  # from the repository root, once built
#   BUILD_DIR=build-x ./bench/run.sh --benchmark_filter=Delivery
#
# Every benchmark runs REPETITIONS times (default 10); only the aggregates go
# to the JSON file, $BUILD_DIR/bench-results.json, from which tarn-bench-table
# makes the Markdown tables (also saved as $BUILD_DIR/bench-table.md). Extra
# arguments go to the benchmark program. Exits non-zero when a benchmark fails
# its correctness check or the results cannot be read.
set -euo pipefail

cd "$(dirname "$0")/.."
BUILD_DIR=${BUILD_DIR:-build/default}
REPETITIONS=${REPETITIONS:-10}
bench="$BUILD_DIR/bench/tarn-bench"
table="$BUILD_DIR/bench/tarn-bench-table"
results="$BUILD_DIR/bench-results.json"

if [ ! -x "$bench" ] || [ ! -x "$table" ]; then
  echo "run.sh: $bench is not built; Google Benchmark (libbenchmark-dev) may be missing" >&2
  exit 1
fi

echo "run.sh: $(nproc) CPUs, load average $(cut -d' ' -f1-3 /proc/loadavg); results in $results"
echo "run.sh: the figures are noisy while other work runs; compare ratios within one run"

# The console shows the medians only; the JSON keeps every aggregate.
set +e
"$bench" --benchmark_repetitions="$REPETITIONS" --benchmark_report_aggregates_only=true \
  --benchmark_enable_random_interleaving=true \
  --benchmark_out="$results" --benchmark_out_format=json "$@" |
  grep --line-buffered -E '_median|ERROR|^Benchmark|^---'
bench_status=${PIPESTATUS[0]}
echo
"$table" "$results" | tee "$BUILD_DIR/bench-table.md"
table_status=${PIPESTATUS[0]}
set -e

if [ "$bench_status" -ne 0 ]; then
  echo "run.sh: the benchmark program failed (status $bench_status); see the checks above" >&2
  exit 1
fi
exit "$table_status"
