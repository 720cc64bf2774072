// The benchmark program's entry point. The thread that runs main() is made
// Tarn's main thread before any benchmark runs; Google Benchmark runs every
// single-threaded benchmark on the thread that calls RunSpecifiedBenchmarks,
// so broadcasts and flushes happen on that thread as they would in a host.
//
// The exit status is non-zero when any benchmark failed its correctness
// check, so that run.sh never prints a table built on a wrong result.
#include "BenchSupport.h"

#include <cstdio>

int main(int argc, char** argv) {
  Tarn::Messaging::Initialize();
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 2;
  benchmark::AddCustomContext("tarn_benchmark_checks", "every scenario is checked after it runs");
  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  Tarn::Messaging::Terminate();
  if (TarnBench::AnyCheckFailed()) {
    std::fputs("tarn-bench: at least one benchmark failed its correctness check\n", stderr);
    return 1;
  }
  return 0;
}
