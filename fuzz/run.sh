#!/usr/bin/env bash
# Builds the operations fuzzer with clang, AddressSanitizer, UBSan and
# libFuzzer in build/fuzz, then runs it for SECONDS (default 60) over a copy
# of the seed corpus in fuzz/corpus, and the wire decoder's target, where the
# remote library is built, for DECODER_SECONDS (default 5) over fuzz/corpus-wire.
# Prints the number of executions of each.
#
#   fuzz/run.sh           # one minute
#   fuzz/run.sh 600       # ten minutes
#   JOBS=1 fuzz/run.sh    # build with one job
#
# A crash leaves its input in build/fuzz/ (crash-*, leak-*, timeout-*);
# replay it with build/fuzz/fuzz/tarn_fuzz_operations <file>.
set -euo pipefail

seconds="${1:-60}"
root="$(cd "$(dirname "${BASH_SOURCE[0]}")/.." && pwd)"
build="${TARN_FUZZ_BUILD_DIR:-$root/build/fuzz}"

cmake -S "$root" -B "$build" \
  -DCMAKE_CXX_COMPILER=clang++ \
  -DCMAKE_BUILD_TYPE=RelWithDebInfo \
  -DTARN_BUILD_FUZZER=ON \
  -DTARN_SANITIZE=address \
  -DTARN_BUILD_TESTS=OFF \
  -DTARN_BUILD_BENCHMARKS=OFF \
  -DTARN_BUILD_EXAMPLES=OFF > "$build.configure.log" 2>&1 || { cat "$build.configure.log"; exit 1; }
cmake --build "$build" --target tarn_fuzz_operations -j "${JOBS:-2}"
have_decoder=0
# The list is read whole: grep -q would stop reading early, and under
# pipefail the cut-off build tool would make the test fail.
if cmake --build "$build" --target help | grep tarn_fuzz_wire_decoder > /dev/null; then
  cmake --build "$build" --target tarn_fuzz_wire_decoder -j "${JOBS:-2}"
  have_decoder=1
fi

# The fuzzer adds what it finds to the corpus it is given: work on a copy,
# so that the checked-in seeds stay as they are.
corpus="$build/corpus"
rm -rf "$corpus"
mkdir -p "$corpus"
cp "$root"/fuzz/corpus/* "$corpus"/

log="$build/fuzz.log"
cd "$build"
set +e
ASAN_OPTIONS="detect_leaks=1:${ASAN_OPTIONS:-}" \
  "$build/fuzz/tarn_fuzz_operations" -max_total_time="$seconds" -print_final_stats=1 -timeout=20 "$corpus" > "$log" 2>&1
status=$?
set -e
tail -n 25 "$log"
executions="$(sed -n 's/^stat::number_of_executed_units: *//p' "$log" | tail -n 1)"
echo "tarn_fuzz_operations: ${executions:-?} executions in ${seconds} s (exit status ${status}); log: $log"
[ "$status" -eq 0 ] || exit "$status"

if [ "$have_decoder" -eq 1 ]; then
  decoder_seconds="${DECODER_SECONDS:-5}"
  rm -rf "$build/corpus-wire"
  cp -r "$root/fuzz/corpus-wire" "$build/corpus-wire"
  log="$build/fuzz-wire.log"
  set +e
  ASAN_OPTIONS="detect_leaks=1:${ASAN_OPTIONS:-}" \
    "$build/fuzz/tarn_fuzz_wire_decoder" -max_total_time="$decoder_seconds" -print_final_stats=1 -timeout=20 \
    "$build/corpus-wire" > "$log" 2>&1
  status=$?
  set -e
  tail -n 5 "$log"
  executions="$(sed -n 's/^stat::number_of_executed_units: *//p' "$log" | tail -n 1)"
  echo "tarn_fuzz_wire_decoder: ${executions:-?} executions in ${decoder_seconds} s (exit status ${status}); log: $log"
else
  echo "tarn_fuzz_wire_decoder: the remote library is not built here (libzmq, cppzmq, msgpack-cxx): skipped"
fi
exit "$status"
