#!/usr/bin/env bash
# Runs the benchmark program and prints the table of medians and the ratio
# against every target, then draws the chart.
#
#   make bench                      # builds build/default, then runs this
#   ./bench/run.sh                  # from the repository root, once built
#   BUILD_DIR=build-x REPETITIONS=3 ./bench/run.sh --benchmark_filter=Delivery
#
# Every benchmark runs REPETITIONS times (default 5); only the aggregates go
# to $BUILD_DIR/bench-results.json. The posting benchmarks then run
# POSTING_RUNS - 1 more times (default 3 runs in all), since asio's posting
# rate swings between runs; the report gives the range of the ratios. The
# table goes to $BUILD_DIR/bench-table.md, the chart to
# $BUILD_DIR/performance.svg. Extra arguments go to the benchmark program.
# Exits non-zero when a benchmark fails its correctness check or the results
# cannot be read.
set -euo pipefail

cd "$(dirname "$0")/.."
BUILD_DIR=${BUILD_DIR:-build/default}
REPETITIONS=${REPETITIONS:-5}
POSTING_RUNS=${POSTING_RUNS:-3}
bench="$BUILD_DIR/bench/tarn-bench"

if [ ! -x "$bench" ]; then
  echo "run.sh: $bench is not built; Google Benchmark (libbenchmark-dev) may be missing" >&2
  exit 1
fi

echo "run.sh: $(nproc) CPUs, load average $(cut -d' ' -f1-3 /proc/loadavg)"
echo "run.sh: the figures are noisy while other work runs; compare ratios within one run"

run() {  # run OUTPUT.json [benchmark arguments...]
  local out=$1
  shift
  "$bench" --benchmark_repetitions="$REPETITIONS" --benchmark_report_aggregates_only=true \
    --benchmark_enable_random_interleaving=true --benchmark_out="$out" --benchmark_out_format=json "$@" |
    grep --line-buffered -E '_median|ERROR|^Benchmark|^---'
}

status=0
run "$BUILD_DIR/bench-results.json" "$@" || status=1
extra=()
for ((i = 2; i <= POSTING_RUNS; i++)); do
  echo "run.sh: posting benchmarks, run $i of $POSTING_RUNS"
  run "$BUILD_DIR/bench-posting-$i.json" --benchmark_filter='^Posting/' || status=1
  extra+=("$BUILD_DIR/bench-posting-$i.json")
done
echo
set +e
python3 bench/report.py "$BUILD_DIR/bench-results.json" --posting "${extra[@]}" --svg "$BUILD_DIR/performance.svg" |
  tee "$BUILD_DIR/bench-table.md"
report_status=${PIPESTATUS[0]}
set -e
# Stations across processes, where the remote library is built.
if [ -x "$BUILD_DIR/bench/tarn-remote-bench" ]; then
  echo
  "$BUILD_DIR/bench/tarn-remote-bench" | tee "$BUILD_DIR/bench-remote.md" || status=1
fi
if [ "$status" -ne 0 ]; then
  echo "run.sh: the benchmark program failed; see the checks above" >&2
  exit 1
fi
exit "$report_status"
