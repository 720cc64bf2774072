// tarn-demo: a small host application for TarnMessaging. Run it with --help
// for what it does and its options; DemoHost.cpp is the place to start
// reading.
#include "DemoHost.h"
#include "DemoOptions.h"
#ifdef TARN_DEMO_REMOTE
#include "RemoteDemo.h"
#endif
#include "SlowHandlers.h"
#include "Summary.h"

#include <TarnMessaging/Tracing.h>

#include <chrono>
#include <cstdio>
#include <optional>
#include <string>

int main(int argc, char** argv) {
#ifdef TARN_DEMO_REMOTE
  if (tarn_demo::IsRemoteDemo(argc, argv)) return tarn_demo::RunRemoteDemo(argc, argv);
#endif
  tarn_demo::DemoOptions options;
  std::string error;
  switch (tarn_demo::ParseDemoOptions(argc, argv, options, error)) {
    case tarn_demo::ParseResult::kHelp:
      tarn_demo::PrintDemoHelp(stdout);
      return 0;
    case tarn_demo::ParseResult::kError:
      std::fprintf(stderr, "tarn-demo: %s\nTry 'tarn-demo --help' for the options.\n", error.c_str());
      return 2;
    case tarn_demo::ParseResult::kRun:
      break;
  }

  // Installed and removed on this, the main thread, outside every broadcast:
  // no delivery can reach it after it is removed.
  std::optional<tarn_demo::SlowHandlers> slow;
  if (options.mTraceSlowMilliSeconds >= 0) {
    slow.emplace(std::chrono::milliseconds(options.mTraceSlowMilliSeconds));
    Tarn::Tracing::SetDeliveryTracer(&*slow);
  }
  tarn_demo::DemoSummary summary = tarn_demo::RunDemo(options);
  if (slow) Tarn::Tracing::SetDeliveryTracer(nullptr);
  tarn_demo::CheckSummary(summary);
  if (options.mJson) {
    tarn_demo::PrintSummaryJson(summary, stdout);
  } else {
    tarn_demo::PrintSummaryTable(summary, stdout);
  }
  if (slow) slow->Print(options.mJson ? stderr : stdout);
  // A lost or duplicated message, a leak, or any other failed check.
  return summary.mFaults.empty() ? 0 : 1;
}
