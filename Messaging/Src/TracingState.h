// What the broadcaster shares with Tracing.cpp: the one flag a broadcast
// reads to decide whether it is traced, the record of the main thread's
// current delivery that a removal-wait report names, and the reports
// themselves.
#pragma once

#include <TarnMessaging/Tracing.h>

#include <atomic>
#include <chrono>
#include <string>

namespace Tarn::TracingState {

// True while a tracer is installed or a removal-wait report is set: only
// then does a broadcast take its traced path. Read relaxed, once per
// broadcast; the tracer itself is read with acquire once the flag is seen.
extern std::atomic<bool> sActive;

Tracing::DeliveryTracer* CurrentTracer() noexcept;
// Zero when removals do not report.
std::chrono::milliseconds RemovalWaitThreshold() noexcept;

// True on a thread that is inside a tracer call: its broadcasts go
// untraced, so that a tracer that broadcasts does not hear itself.
bool InsideTracer() noexcept;
class TracerCall {
public:
  TracerCall() noexcept;
  ~TracerCall();
  TracerCall(const TracerCall&) = delete;
  TracerCall& operator=(const TracerCall&) = delete;
};

// One traced delivery in progress, on the broadcasting thread's stack. The
// innermost is published (under a process-wide lock) so that a removal-wait
// report can name it; mDelivery is not changed while it is published.
class CurrentDelivery {
public:
  explicit CurrentDelivery(const Tracing::Delivery& inDelivery) noexcept;
  ~CurrentDelivery();
  CurrentDelivery(const CurrentDelivery&) = delete;
  CurrentDelivery& operator=(const CurrentDelivery&) = delete;

private:
  friend std::string DescribeCurrentDelivery();
  const Tracing::Delivery& mDelivery;
  std::chrono::steady_clock::time_point mStart;
  CurrentDelivery* mOuter;
};

// "<Type> to <kind> listener <address>" and the like.
std::string DescribeListener(const void* inAddress, Tracing::ListenerKind inKind);
std::string DescribeBroadcaster(const void* inBroadcaster, const kivcore::utility::ImmutableString& inStationID);
// The innermost delivery on the main thread, or a sentence saying there is none.
std::string DescribeCurrentDelivery();

// Hands the removal-wait report to ThrowError inside GuardedCall. Never throws.
void ReportRemovalWait(const std::string& inText) noexcept;

// The contract-check procedure for a check that cannot let an exception out
// (a destructor): dialog, optional debugger break, then ThrowError inside
// GuardedCall, so that a throwing error handler reaches the exception handler.
void ReportMisuse(const char* inCondition, const char* inFile, const char* inFunction, int inLine) noexcept;

}  // namespace Tarn::TracingState
