// The status bar of tarn-demo: a plain-pointer listener on kStation_StatusBar
// that keeps the books on every progress message delivered (which worker and
// sequence number, duplicates, post-to-delivery latency) and draws a
// progress line.
//
//   StatusBar bar(DisplayMode::kLiveLine, perWorkerCounts, ledger);
//   Tarn::StationUtils::AddListener(Tarn::kStation_StatusBar, &bar);
//   ... main thread runs its pending calls ...
//   bar.Note("autosave 1");   // an event line between progress updates
//   bar.Finish();
//
// On a terminal the line is redrawn in place (carriage return), at most ten
// times a second; otherwise a plain line is written every half second.
//
// Threading: main thread only, like the deliveries that drive it.
#pragma once

#include "MeteredStation.h"

#include <TarnMessaging.h>

#include <cstdint>
#include <string>
#include <vector>

namespace tarn_demo {

enum class DisplayMode { kNone, kLiveLine, kPlainLines };

class StatusBar : public Tarn::Listener {
public:
  // inPerWorker[w]: how many messages worker w posts; sequence numbers run
  // from 0 below that.
  StatusBar(DisplayMode inMode, const std::vector<std::uint32_t>& inPerWorker, const DropLedger& inLedger);

  void ListenToMessage(const Tarn::Message& inMessage) override;

  // Writes one event line, keeping the live line intact below it.
  void Note(const std::string& inText);
  // Draws the final figures and ends the live line.
  void Finish();

  std::uint64_t Delivered() const { return mDelivered; }
  // Deliveries of a (worker, sequence) pair already delivered.
  std::uint64_t Duplicates() const { return mDuplicates; }
  // Deliveries naming a worker or sequence number that was never posted.
  std::uint64_t Strays() const { return mStrays; }
  // SteadyNanoSeconds() of the latest delivery; 0 before the first.
  std::int64_t LastDeliveryAt() const { return mLastDeliveryAt; }
  // Post-to-delivery latency of every delivery, in microseconds.
  std::vector<std::uint32_t>& Latencies() { return mLatencies; }

private:
  void Draw(std::int64_t inNow);
  std::string Line() const;

  const DisplayMode mMode;
  const DropLedger& mLedger;
  std::uint64_t mTotal = 0;
  std::vector<std::vector<std::uint8_t>> mSeen;  // [worker][sequence]: delivered yet
  std::vector<std::uint32_t> mLatencies;
  std::uint64_t mDelivered = 0;
  std::uint64_t mDuplicates = 0;
  std::uint64_t mStrays = 0;
  std::int64_t mLastDeliveryAt = 0;
  std::int64_t mNextDrawAt = 0;
  std::size_t mDrawnWidth = 0;  // characters of the live line on screen now
};

}  // namespace tarn_demo
