// The figures of one tarn-demo run, the checks made on them, and the two ways
// of printing them (a table for people, one JSON object for scripts).
//
//   DemoSummary summary = RunDemo(options);
//   CheckSummary(summary);                 // fills mFaults
//   PrintSummaryTable(summary, stdout);
//   return summary.mFaults.empty() ? 0 : 1;
#pragma once

#include <cstdint>
#include <cstdio>
#include <string>
#include <vector>

namespace tarn_demo {

struct DemoSummary {
  // The run's settings.
  std::uint32_t mWorkers = 0;
  std::uint64_t mMessages = 0;
  std::uint32_t mIdleMilliSeconds = 0;

  // Accounting of the progress messages.
  std::uint64_t mPosted = 0;           // posts the workers made
  std::uint64_t mDelivered = 0;        // deliveries the status bar heard
  std::uint64_t mDroppedByDesign = 0;  // reached the status-bar station while it was stopped
  std::int64_t mLost = 0;              // posted - delivered - dropped by design
  std::uint64_t mDuplicates = 0;       // a (worker, sequence) pair delivered again
  std::uint64_t mStrays = 0;           // a (worker, sequence) pair never posted

  // The coalesced progress meter: updates posted against updates delivered.
  std::uint64_t mMeterPosted = 0;
  std::uint64_t mMeterDelivered = 0;
  std::uint64_t mMeterRegressions = 0;  // an update no newer than the one before it
  std::uint32_t mMeterUnfinished = 0;   // workers whose last update was never heard

  // Cross-checks: what the other listeners and the station itself counted.
  std::uint64_t mArrivedWhileBroadcasting = 0;  // the station's own count of what it delivered
  std::uint64_t mTypedHeard = 0;
  std::uint64_t mStdWeakHeard = 0;
  std::uint64_t mDetachedListenerHeard = 0;
  std::uint64_t mDetachViolations = 0;
  bool mDetachedListenerGone = false;
  bool mDetachedMidDelivery = false;  // a delivery to it was running when its removal began
  std::uint64_t mSuspends = 0;
  std::uint64_t mResumes = 0;

  // Timing.
  std::uint32_t mLatencyP50 = 0;  // microseconds, post to delivery
  std::uint32_t mLatencyP99 = 0;
  std::uint32_t mLatencyMax = 0;
  double mBusySeconds = 0;        // from the start of each burst to its last delivery, summed
  double mMessagesPerSecond = 0;  // delivered / busy seconds
  double mWallSeconds = 0;

  // Storage and the timer.
  std::int64_t mLeakedBlocks = 0;  // small blocks in use after Terminate beyond those before Initialize
  std::uint64_t mAutosaves = 0;
  std::uint32_t mBursts = 0;

  // What went wrong, one sentence each; empty for a clean run.
  std::vector<std::string> mFaults;
};

// Adds a fault for every figure that shows a lost, duplicated or misrouted
// message, a leak, or a listener that disagrees with the status bar.
void CheckSummary(DemoSummary& ioSummary);

void PrintSummaryTable(const DemoSummary& inSummary, std::FILE* inStream);
void PrintSummaryJson(const DemoSummary& inSummary, std::FILE* inStream);

}  // namespace tarn_demo
