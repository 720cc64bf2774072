#include "StatusBar.h"

#include "DemoMessages.h"
#include "TextFormat.h"

#include <cstdio>
#include <limits>

namespace tarn_demo {

namespace {
constexpr std::int64_t kLiveInterval = 100000000;   // ns: ten redraws a second
constexpr std::int64_t kPlainInterval = 500000000;  // ns: two plain lines a second
}  // namespace

StatusBar::StatusBar(DisplayMode inMode, const std::vector<std::uint32_t>& inPerWorker, const DropLedger& inLedger)
    : mMode(inMode), mLedger(inLedger) {
  mSeen.reserve(inPerWorker.size());
  for (const std::uint32_t count : inPerWorker) {
    mSeen.emplace_back(count, 0);
    mTotal += count;
  }
  // Reserved up front so that no reallocation lands in the middle of the
  // latency figures being measured.
  mLatencies.reserve(mTotal);
}

void StatusBar::ListenToMessage(const Tarn::Message& inMessage) {
  if (inMessage.GetMessageID() != ProgressMessage::StaticMessageID()) return;
  const auto& progress = static_cast<const ProgressMessage&>(inMessage);
  const std::int64_t now = SteadyNanoSeconds();
  ++mDelivered;
  mLastDeliveryAt = now;

  if (progress.mWorker >= mSeen.size() || progress.mSequence >= mSeen[progress.mWorker].size()) {
    ++mStrays;
  } else {
    std::uint8_t& seen = mSeen[progress.mWorker][progress.mSequence];
    if (seen != 0) ++mDuplicates;
    seen = 1;
  }

  const std::int64_t latency = (now - progress.mPostedAt) / 1000;
  if (latency < 0) {
    mLatencies.push_back(0);
  } else {
    mLatencies.push_back(latency > std::numeric_limits<std::uint32_t>::max() ? std::numeric_limits<std::uint32_t>::max()
                                                                             : static_cast<std::uint32_t>(latency));
  }

  if (mMode != DisplayMode::kNone && now >= mNextDrawAt) Draw(now);
}

std::string StatusBar::Line() const {
  const std::uint64_t handled = mDelivered + mLedger.mDroppedWhileStopped;
  const unsigned percent = mTotal == 0 ? 100u : static_cast<unsigned>(handled * 100 / mTotal);
  return "progress " + std::to_string(percent) + "%  delivered " + WithSeparators(mDelivered) + "  dropped " +
         WithSeparators(mLedger.mDroppedWhileStopped) + "  of " + WithSeparators(mTotal);
}

void StatusBar::Draw(std::int64_t inNow) {
  const std::string line = Line();
  if (mMode == DisplayMode::kLiveLine) {
    // Pad with blanks so that a shorter line leaves nothing of the last one.
    const std::size_t padding = mDrawnWidth > line.size() ? mDrawnWidth - line.size() : 0;
    std::printf("\r%s%*s", line.c_str(), static_cast<int>(padding), "");
    mDrawnWidth = line.size();
    mNextDrawAt = inNow + kLiveInterval;
  } else {
    std::printf("%s\n", line.c_str());
    mNextDrawAt = inNow + kPlainInterval;
  }
  std::fflush(stdout);
}

void StatusBar::Note(const std::string& inText) {
  if (mMode == DisplayMode::kNone) return;
  if (mMode == DisplayMode::kLiveLine && mDrawnWidth > 0) {
    const std::size_t padding = mDrawnWidth > inText.size() ? mDrawnWidth - inText.size() : 0;
    std::printf("\r%s%*s\n", inText.c_str(), static_cast<int>(padding), "");
    mDrawnWidth = 0;
    // The progress line comes back at the next delivery.
    mNextDrawAt = 0;
  } else {
    std::printf("%s\n", inText.c_str());
  }
  std::fflush(stdout);
}

void StatusBar::Finish() {
  if (mMode == DisplayMode::kNone) return;
  Draw(SteadyNanoSeconds());
  if (mMode == DisplayMode::kLiveLine) {
    std::printf("\n");
    mDrawnWidth = 0;
  }
  std::fflush(stdout);
}

}  // namespace tarn_demo
