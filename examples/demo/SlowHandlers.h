// --trace-slow: a delivery tracer that keeps, per handler (listener, station
// and message type), how often it ran and how long it took, and prints the
// slowest like a profiler's top list.
//
//   SlowHandlers slow(std::chrono::milliseconds(5));
//   Tarn::Tracing::SetDeliveryTracer(&slow);     // main thread, before the run
//   ... run ...
//   Tarn::Tracing::SetDeliveryTracer(nullptr);   // main thread, after it
//   slow.Print(stdout);
//
// Threading: the library calls the tracer on the main thread only; Print
// once the tracer is no longer installed.
#pragma once

#include <TarnMessaging/Tracing.h>

#include <chrono>
#include <cstdint>
#include <cstdio>
#include <map>
#include <string>
#include <tuple>

namespace tarn_demo {

class SlowHandlers : public Tarn::Tracing::DeliveryTracer {
public:
  // Handlers whose slowest delivery took at least inThreshold are listed.
  explicit SlowHandlers(std::chrono::milliseconds inThreshold) : mThreshold(inThreshold) {}

  void DeliveryBegins(const Tarn::Tracing::Delivery& inDelivery) override;
  void DeliveryEnded(const Tarn::Tracing::Delivery& inDelivery, std::chrono::nanoseconds inDuration) override;

  // The ten slowest handlers by their slowest delivery, and how many
  // deliveries were traced in all.
  void Print(std::FILE* inStream) const;

private:
  struct Figures {
    std::string mListener;  // the listener's type when known, else its kind and address
    std::uint64_t mCalls = 0;
    std::chrono::nanoseconds mTotal{0};
    std::chrono::nanoseconds mLongest{0};
  };
  // Listener address, station and message type name identify one handler.
  using Key = std::tuple<const void*, std::string, const char*>;

  const std::chrono::milliseconds mThreshold;
  std::map<Key, Figures> mHandlers;  // main thread only
  std::uint64_t mDeliveries = 0;
  std::string mBeginning;  // the type of the plain listener about to be called, read while it surely lives
};

}  // namespace tarn_demo
