#include "Summary.h"

#include "TextFormat.h"

#include <cinttypes>

namespace tarn_demo {

namespace {

void AddFault(DemoSummary& ioSummary, const std::string& inText) { ioSummary.mFaults.push_back(inText); }

std::string Count(std::uint64_t inValue) { return WithSeparators(inValue); }

std::string JsonString(const std::string& inText) {
  std::string quoted = "\"";
  for (const char c : inText) {
    if (c == '"' || c == '\\') {
      quoted += '\\';
      quoted += c;
    } else if (static_cast<unsigned char>(c) < 0x20) {
      char escape[8];
      std::snprintf(escape, sizeof escape, "\\u%04x", static_cast<unsigned>(c));
      quoted += escape;
    } else {
      quoted += c;
    }
  }
  return quoted + "\"";
}

}  // namespace

void CheckSummary(DemoSummary& ioSummary) {
  DemoSummary& s = ioSummary;
  s.mLost = static_cast<std::int64_t>(s.mPosted) - static_cast<std::int64_t>(s.mDelivered) -
            static_cast<std::int64_t>(s.mDroppedByDesign);
  if (s.mLost > 0)
    AddFault(s, Count(static_cast<std::uint64_t>(s.mLost)) + " posted messages were never accounted for");
  if (s.mLost < 0)
    AddFault(s, Count(static_cast<std::uint64_t>(-s.mLost)) + " more messages were delivered or dropped than posted");
  if (s.mPosted != s.mMessages)
    AddFault(s, "the workers posted " + Count(s.mPosted) + " messages instead of " + Count(s.mMessages));
  if (s.mMeterPosted != s.mMessages)
    AddFault(s, "the workers made " + Count(s.mMeterPosted) + " meter updates instead of " + Count(s.mMessages));
  if (s.mMeterDelivered > s.mMeterPosted || s.mMeterRegressions != 0)
    AddFault(s, "the coalesced meter heard " + Count(s.mMeterRegressions) + " stale or repeated updates (" +
                    Count(s.mMeterDelivered) + " heard of " + Count(s.mMeterPosted) + " posted)");
  if (s.mMeterUnfinished != 0)
    AddFault(s, "the meter never heard the last update of " + Count(s.mMeterUnfinished) + " workers");
  if (s.mDuplicates != 0) AddFault(s, Count(s.mDuplicates) + " messages were delivered more than once");
  if (s.mStrays != 0) AddFault(s, Count(s.mStrays) + " deliveries carried a worker or sequence number never posted");
  if (s.mArrivedWhileBroadcasting != s.mDelivered)
    AddFault(s, "the status-bar station broadcast " + Count(s.mArrivedWhileBroadcasting) +
                    " progress messages but the status bar heard " + Count(s.mDelivered));
  if (s.mTypedHeard != s.mDelivered)
    AddFault(s, "the typed subscription heard " + Count(s.mTypedHeard) + " messages, the status bar " +
                    Count(s.mDelivered));
  if (s.mStdWeakHeard != s.mDelivered)
    AddFault(s, "the std::weak_ptr listener heard " + Count(s.mStdWeakHeard) + " messages, the status bar " +
                    Count(s.mDelivered));
  if (!s.mDetachedListenerGone) AddFault(s, "the listener handed to a worker was not destroyed");
  if (s.mDetachViolations != 0)
    AddFault(
        s, "a listener was called during or after its removal on a worker (" + Count(s.mDetachViolations) + " times)");
  if (s.mSuspends != 1 || s.mResumes != 1)
    AddFault(s, "the safe listener heard " + Count(s.mSuspends) + " suspends and " + Count(s.mResumes) +
                    " resumes instead of one each");
  if (s.mAutosaves < s.mBursts)
    AddFault(s, "only " + Count(s.mAutosaves) + " autosaves for " + Count(s.mBursts) + " bursts of work");
  if (s.mLeakedBlocks > 0)
    AddFault(s, Count(static_cast<std::uint64_t>(s.mLeakedBlocks)) + " small blocks still in use after Terminate");
}

void PrintSummaryTable(const DemoSummary& inSummary, std::FILE* inStream) {
  const DemoSummary& s = inSummary;
  const auto row = [inStream](const char* inName, const std::string& inValue) {
    std::fprintf(inStream, "  %-34s %s\n", inName, inValue.c_str());
  };
  char buffer[64];
  std::fprintf(inStream, "\ntarn-demo summary (%u workers, %s messages, idle %u ms)\n", s.mWorkers,
               Count(s.mMessages).c_str(), s.mIdleMilliSeconds);
  row("messages posted", Count(s.mPosted));
  row("delivered", Count(s.mDelivered));
  row("dropped by design (while stopped)", Count(s.mDroppedByDesign));
  std::snprintf(buffer, sizeof buffer, "%" PRId64, s.mLost);
  row("lost", buffer);
  row("delivered twice", Count(s.mDuplicates));
  row("meter updates posted / delivered", Count(s.mMeterPosted) + " / " + Count(s.mMeterDelivered) + " (coalesced)");
  row("latency p50 / p99 / max (us)",
      Count(s.mLatencyP50) + " / " + Count(s.mLatencyP99) + " / " + Count(s.mLatencyMax));
  row("messages per second (while busy)", Count(static_cast<std::uint64_t>(s.mMessagesPerSecond)));
  std::snprintf(buffer, sizeof buffer, "%" PRId64, s.mLeakedBlocks);
  row("small blocks leaked", buffer);
  row("autosaves fired", Count(s.mAutosaves) + " (" + Count(s.mBursts) + " bursts of work)");
  row("listener destroyed by a worker",
      std::string(s.mDetachViolations == 0 && s.mDetachedListenerGone ? "cleanly" : "NOT cleanly") +
          (s.mDetachedMidDelivery ? ", during a delivery to it" : "") + ", after hearing " +
          Count(s.mDetachedListenerHeard));
  std::snprintf(buffer, sizeof buffer, "%.2f s (busy %.2f s)", s.mWallSeconds, s.mBusySeconds);
  row("wall time", buffer);
  if (s.mFaults.empty()) {
    std::fprintf(inStream, "result: OK, every message accounted for\n");
  } else {
    std::fprintf(inStream, "result: FAILED\n");
    for (const std::string& fault : s.mFaults) std::fprintf(inStream, "  - %s\n", fault.c_str());
  }
}

void PrintSummaryJson(const DemoSummary& inSummary, std::FILE* inStream) {
  const DemoSummary& s = inSummary;
  std::string faults = "[";
  for (std::size_t i = 0; i < s.mFaults.size(); ++i) faults += (i == 0 ? "" : ",") + JsonString(s.mFaults[i]);
  faults += "]";
  std::fprintf(inStream,
               "{\"workers\":%u,\"messages\":%" PRIu64
               ",\"idle_ms\":%u,"
               "\"posted\":%" PRIu64 ",\"delivered\":%" PRIu64 ",\"dropped_by_design\":%" PRIu64 ",\"lost\":%" PRId64
               ",\"duplicates\":%" PRIu64
               ",\"meter_posted\":%" PRIu64 ",\"meter_delivered\":%" PRIu64
               ","
               "\"latency_us\":{\"p50\":%u,\"p99\":%u,\"max\":%u},"
               "\"messages_per_second\":%.0f,\"busy_seconds\":%.3f,\"wall_seconds\":%.3f,"
               "\"leaked_blocks\":%" PRId64 ",\"autosaves\":%" PRIu64
               ",\"bursts\":%u,"
               "\"suspends\":%" PRIu64 ",\"resumes\":%" PRIu64
               ","
               "\"detached_listener_heard\":%" PRIu64
               ",\"detached_mid_delivery\":%s,"
               "\"detach_violations\":%" PRIu64
               ","
               "\"ok\":%s,\"faults\":%s}\n",
               s.mWorkers, s.mMessages, s.mIdleMilliSeconds, s.mPosted, s.mDelivered, s.mDroppedByDesign, s.mLost,
               s.mDuplicates, s.mMeterPosted, s.mMeterDelivered, s.mLatencyP50, s.mLatencyP99, s.mLatencyMax, s.mMessagesPerSecond, s.mBusySeconds,
               s.mWallSeconds, s.mLeakedBlocks, s.mAutosaves, s.mBursts, s.mSuspends, s.mResumes,
               s.mDetachedListenerHeard, s.mDetachedMidDelivery ? "true" : "false", s.mDetachViolations,
               s.mFaults.empty() ? "true" : "false", faults.c_str());
}

}  // namespace tarn_demo
