// The command line of tarn-demo.
//
//   DemoOptions options;
//   std::string error;
//   switch (ParseDemoOptions(argc, argv, options, error)) {
//     case ParseResult::kRun:   ...;
//     case ParseResult::kHelp:  PrintDemoHelp(stdout); return 0;
//     case ParseResult::kError: std::fprintf(stderr, "tarn-demo: %s\n", error.c_str()); return 2;
//   }
#pragma once

#include <cstdint>
#include <cstdio>
#include <string>

namespace tarn_demo {

struct DemoOptions {
  std::uint32_t mWorkers = 0;             // posting threads; 0 until parsed (the default depends on the machine)
  std::uint64_t mMessages = 200000;       // progress messages, in total over all workers
  std::uint32_t mIdleMilliSeconds = 200;  // quiet time after a burst before the autosave
  bool mQuiet = false;                    // no progress output, only the summary
  bool mJson = false;                     // the summary as one JSON object, nothing else on stdout
  bool mDumpStations = false;             // the station registry's snapshot at the end of the run
  std::int64_t mTraceSlowMilliSeconds = -1;  // --trace-slow: list handlers at least this slow; -1: no tracing
};

enum class ParseResult { kRun, kHelp, kError };

// Fills outOptions from the arguments (argv[0] is skipped). On kError,
// outError says what was wrong, in one line.
ParseResult ParseDemoOptions(int inArgc, const char* const* inArgv, DemoOptions& outOptions, std::string& outError);

// The workers used when --workers is not given: one per hardware thread, at
// least two.
std::uint32_t DefaultWorkerCount();

void PrintDemoHelp(std::FILE* inStream);

}  // namespace tarn_demo
