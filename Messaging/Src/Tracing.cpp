#include <TarnMessaging/Tracing.h>

#include "ContractCheck.h"
#include "TracingState.h"

#include <kivcore/Debug.h>
#include <kivcore/Error.h>

#include <boost/function.hpp>
#include <boost/ref.hpp>

#include <cxxabi.h>

#include <csignal>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <mutex>

namespace Tarn {

namespace {

constexpr const char* kReadableTypeName = "Tarn::Tracing::ReadableTypeName";

#ifdef NDEBUG
constexpr std::int64_t kStartThreshold = 0;
#else
constexpr std::int64_t kStartThreshold = Tracing::kDefaultRemovalWaitReport.count();
#endif

// The setters change the tracer, the threshold and the flag together, so
// that two of them racing cannot leave the flag off with a tracer installed.
std::mutex sSettingsMutex;
std::atomic<Tracing::DeliveryTracer*> sTracer{nullptr};       // written under sSettingsMutex
std::atomic<std::int64_t> sThresholdMs{kStartThreshold};       // written under sSettingsMutex

thread_local int sTracerDepth = 0;  // tracer calls running on this thread

// Traced deliveries in progress, innermost first. Only the main thread
// delivers; a thread that stopped being the main thread while a broadcast
// ran may still push and pop, so each entry is taken out where it is rather
// than by restoring a saved head.
std::mutex sCurrentMutex;
TracingState::CurrentDelivery* sInnermost = nullptr;  // guarded by sCurrentMutex

void UpdateActive() {
  TracingState::sActive.store(sTracer.load(std::memory_order_relaxed) != nullptr ||
                                  sThresholdMs.load(std::memory_order_relaxed) > 0,
                              std::memory_order_relaxed);
}

const char* KindName(Tracing::ListenerKind inKind) {
  switch (inKind) {
    case Tracing::ListenerKind::kPlain: return "plain listener";
    case Tracing::ListenerKind::kSafe: return "safe listener";
    case Tracing::ListenerKind::kBoostWeak: return "boost::weak_ptr listener";
    case Tracing::ListenerKind::kStdWeak: return "std::weak_ptr listener";
  }
  return "listener";
}

std::string Address(const void* inAddress) {
  char text[2 + 2 * sizeof(void*) + 1];
  std::snprintf(text, sizeof text, "%p", inAddress);
  return text;
}

}  // namespace

namespace TracingState {

std::atomic<bool> sActive{kStartThreshold > 0};

Tracing::DeliveryTracer* CurrentTracer() noexcept { return sTracer.load(std::memory_order_acquire); }

std::chrono::milliseconds RemovalWaitThreshold() noexcept {
  const std::int64_t threshold = sThresholdMs.load(std::memory_order_relaxed);
  return std::chrono::milliseconds(threshold > 0 ? threshold : 0);
}

bool InsideTracer() noexcept { return sTracerDepth > 0; }
TracerCall::TracerCall() noexcept { ++sTracerDepth; }
TracerCall::~TracerCall() { --sTracerDepth; }

CurrentDelivery::CurrentDelivery(const Tracing::Delivery& inDelivery) noexcept
    : mDelivery(inDelivery), mStart(std::chrono::steady_clock::now()) {
  std::lock_guard<std::mutex> lock(sCurrentMutex);
  mOuter = sInnermost;
  sInnermost = this;
}

CurrentDelivery::~CurrentDelivery() {
  std::lock_guard<std::mutex> lock(sCurrentMutex);
  for (CurrentDelivery** link = &sInnermost; *link != nullptr; link = &(*link)->mOuter) {
    if (*link == this) {
      *link = mOuter;
      return;
    }
  }
}

std::string DescribeListener(const void* inAddress, Tracing::ListenerKind inKind) {
  std::string text = KindName(inKind);
  if (inAddress != nullptr) text += " " + Address(inAddress);
  return text;
}

std::string DescribeBroadcaster(const void* inBroadcaster, const kivcore::utility::ImmutableString& inStationID) {
  if (inStationID.empty()) return "broadcaster " + Address(inBroadcaster);
  return std::string("station \"") + inStationID.c_str() + "\" (broadcaster " + Address(inBroadcaster) + ")";
}

std::string DescribeCurrentDelivery() {
  std::lock_guard<std::mutex> lock(sCurrentMutex);
  if (sInnermost == nullptr) return "The main thread is in no traced delivery.";
  const Tracing::Delivery& delivery = sInnermost->mDelivery;
  const auto busy = std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::steady_clock::now() -
                                                                          sInnermost->mStart);
  return "The main thread has been delivering " + Tracing::ReadableTypeName(delivery.mMessageType) + " to " +
         DescribeListener(delivery.mListener, delivery.mListenerKind) + " on " +
         DescribeBroadcaster(delivery.mBroadcaster, delivery.mStationID) + " for " +
         std::to_string(busy.count()) + " ms.";
}

void ReportRemovalWait(const std::string& inText) noexcept {
  try {
    const std::string key = Tracing::kRemovalWaitKey + inText;
    struct Report {
      const std::string& mKey;
      int operator()() const {
        const kivcore::config::ReplacementValue none;
        kivcore::config::ThrowError(0, mKey.c_str(), 0u, 0, false, none, none, none, none);
        return 0;
      }
    } report{key};
    kivcore::config::ErrorManager::Get(false)->GuardedCall(boost::function<int()>(boost::ref(report)));
  } catch (...) {
    // Out of memory for the text: the removal matters more than its report.
  }
}

void ReportMisuse(const char* inCondition, const char* inFile, const char* inFunction, int inLine) noexcept {
  struct Report {
    const char* mCondition;
    const char* mFile;
    const char* mFunction;
    int mLine;
    int operator()() const {
      if (kivcore::debug::BreakAfterContractDialog(mCondition, mFile, mFunction, mLine) &&
          kivcore::debug::IsDebuggerAttached()) {
        ::raise(SIGTRAP);
      }
      const kivcore::config::ReplacementValue none;
      kivcore::config::ThrowError(0, TARN_CONTRACT_VIOLATION_KEY, 105u, 25, true, none, none, none, none);
      return 0;
    }
  } report{inCondition, inFile, inFunction, inLine};
  try {
    kivcore::config::ErrorManager::Get(false)->GuardedCall(boost::function<int()>(boost::ref(report)));
  } catch (...) {
  }
}

}  // namespace TracingState

namespace Tracing {

void DeliveryTracer::DeliveryBegins(const Delivery&) {}

DeliveryTracer* SetDeliveryTracer(DeliveryTracer* inTracer) noexcept {
  std::lock_guard<std::mutex> lock(sSettingsMutex);
  DeliveryTracer* const previous = sTracer.exchange(inTracer, std::memory_order_acq_rel);
  UpdateActive();
  return previous;
}

std::chrono::milliseconds SetRemovalWaitReport(std::chrono::milliseconds inThreshold) noexcept {
  std::lock_guard<std::mutex> lock(sSettingsMutex);
  const std::int64_t previous =
      sThresholdMs.exchange(inThreshold.count() > 0 ? static_cast<std::int64_t>(inThreshold.count()) : 0,
                            std::memory_order_relaxed);
  UpdateActive();
  return std::chrono::milliseconds(previous);
}

std::string ReadableTypeName(const char* inDecoratedName) {
  TARN_CONTRACT_CHECK(inDecoratedName != NULL, kReadableTypeName);
  if (inDecoratedName == nullptr) return std::string();
  int status = 0;
  const std::unique_ptr<char, void (*)(void*)> readable(abi::__cxa_demangle(inDecoratedName, nullptr, nullptr, &status),
                                                        &std::free);
  if (status != 0 || readable == nullptr) return inDecoratedName;
  return readable.get();
}

}  // namespace Tracing
}  // namespace Tarn
