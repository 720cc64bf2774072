// Wire-enabled message types shared by the remote suites, their child
// program and the decoder's fuzz target, and a bounded run of the main
// thread's pending calls.
#pragma once

#include <TarnMessaging/MessageImpl.h>
#include <TarnMessaging/Remote/WireMessage.h>

#include <cstdint>
#include <string>

namespace remote_test {

enum class Phase : std::int16_t { kStart = -1, kRun = 1, kDone = 300 };

// Every kind of field the wire carries.
struct Progress : Tarn::MessageImpl<Progress> {
  std::int32_t mDone = 0;
  std::uint8_t mSmall = 0;
  std::uint64_t mBig = 0;
  double mRatio = 0;
  bool mFinal = false;
  Phase mPhase = Phase::kStart;
  std::string mLabel;
};
TARN_WIRE_MESSAGE(Progress, "test.progress", 1, mDone, mSmall, mBig, mRatio, mFinal, mPhase, mLabel)

// Numbered, to check order and loss across processes; mSender says which
// process broadcast it first.
struct Tick : Tarn::MessageImpl<Tick> {
  std::uint64_t mNumber = 0;
  std::int32_t mSender = 0;
};
TARN_WIRE_MESSAGE(Tick, "test.tick", 1, mNumber, mSender)

// A state: only the latest value counts.
struct Status : Tarn::MessageImpl<Status> {
  std::int32_t mValue = 0;
};
TARN_WIRE_STATE(Status, "test.status", 1, mValue)

}  // namespace remote_test

#include <TarnMessaging/StationUtils.h>

#include <kivcore/MainThread.h>

#include <chrono>

namespace remote_test {

// Runs the main thread's pending calls, where imported messages are
// delivered, until inDone() holds or inTimeout passes; whether it held.
template <class Predicate>
bool PumpUntil(Predicate inDone, std::chrono::milliseconds inTimeout = std::chrono::seconds(10)) {
  const auto deadline = std::chrono::steady_clock::now() + inTimeout;
  const auto adaptor = kivcore::threads::GetRegisteredMainThread();
  while (!inDone()) {
    if (std::chrono::steady_clock::now() >= deadline || adaptor == nullptr) return inDone();
    if (adaptor->WaitForPendingCalls(10)) Tarn::StationUtils::FlushPostedMessagesOnUIThread();
  }
  return true;
}

}  // namespace remote_test
