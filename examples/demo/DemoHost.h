// The host application of tarn-demo: brings the library up, starts the
// workers, runs the main thread's event loop until the last burst of work
// has been autosaved, shuts everything down and returns the figures.
//
//   DemoSummary summary = RunDemo(options);
//
// Threading: call on the thread that is to be the application's main thread,
// with the library not yet initialized in this process.
#pragma once

#include "DemoOptions.h"
#include "Summary.h"

namespace tarn_demo {

DemoSummary RunDemo(const DemoOptions& inOptions);

}  // namespace tarn_demo
