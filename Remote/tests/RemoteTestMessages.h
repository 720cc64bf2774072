// Wire-enabled message types shared by the remote suites, their child
// program and the decoder's fuzz target.
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

}  // namespace remote_test
