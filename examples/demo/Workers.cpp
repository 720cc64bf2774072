#include "Workers.h"

#include "DemoMessages.h"

#include <TarnMessaging.h>

#include <exception>
#include <utility>

namespace tarn_demo {

namespace {

// Keeps the workers' simulated work from being optimised away.
std::atomic<std::uint64_t> sWorkSink{0};

// A few rounds of a 64-bit mixing function: the "work" behind one progress
// message.
std::uint64_t SimulateWork(std::uint64_t inState) {
  std::uint64_t state = inState;
  for (int round = 0; round < 64; ++round) {
    state ^= state >> 12;
    state ^= state << 25;
    state ^= state >> 27;
    state *= 2685821657736338717ull;
  }
  return state;
}

// The posting loop of RunWorker; returns early only when the run is
// abandoned or a wait times out.
void PostBursts(std::uint32_t inIndex, std::uint32_t inCount, WorkBoard& ioBoard,
                std::unique_ptr<DetachingListener>& ioDoomed, std::chrono::milliseconds inWaitLimit) {
  std::uint64_t state = 0x9E3779B97F4A7C15ull * (inIndex + 1);
  const std::uint32_t destroyAt = inCount / 4;
  std::uint32_t sequence = 0;
  for (std::uint32_t burst = 0; burst < kBursts; ++burst) {
    if (!ioBoard.WaitForBurst(burst, inWaitLimit)) return;
    const auto end = static_cast<std::uint32_t>(std::uint64_t{inCount} * (burst + 1) / kBursts);
    for (; sequence < end; ++sequence) {
      if (!ioBoard.WaitForRoom(inWaitLimit)) return;
      // The delivery of this very post is the one the removal will meet.
      const bool removeNow = ioDoomed && sequence >= destroyAt;
      if (removeNow) ioDoomed->AskForRemoval();
      state = SimulateWork(state);
      Tarn::StationUtils::PostMessageToUIThread(Tarn::kStation_StatusBar,
                                                ProgressMessage(inIndex, sequence, SteadyNanoSeconds()), false);
      ioBoard.NotePosted();
      // The meter wants the newest count only: a coalesced post replaces the
      // update still queued instead of adding one.
      Tarn::StationUtils::PostCoalescedMessageToUIThread(ioBoard.MeterStation(), MeterMessage(inIndex, sequence + 1),
                                                         inIndex);
      ioBoard.NoteMeterPosted();
      if (removeNow) {
        ioDoomed->WaitUntilHeld(std::chrono::seconds(1));
        ioDoomed.reset();
      }
    }
    ioBoard.NoteBurstFinished();
  }
  sWorkSink.fetch_add(state, std::memory_order_relaxed);
}

}  // namespace

ProgressMeter::ProgressMeter(const std::vector<std::uint32_t>& inPerWorker)
    : mPerWorker(inPerWorker),
      mStationID(Tarn::StationRegistry::RegisterUniqueStation()),
      mLastHeard(inPerWorker.size(), 0) {
  Tarn::StationUtils::AddListener(mStationID, this);
}

ProgressMeter::~ProgressMeter() {
  Tarn::StationUtils::RemoveListener(mStationID, this);
  Tarn::StationRegistry::DisposeStation(mStationID);
}

void ProgressMeter::ListenToMessage(const Tarn::Message& inMessage) {
  const MeterMessage* update = inMessage.As<MeterMessage>();
  if (update == nullptr || update->mWorker >= mLastHeard.size()) return;
  ++mDelivered;
  std::uint32_t& last = mLastHeard[update->mWorker];
  if (update->mDone <= last) ++mRegressions;
  else last = update->mDone;
}

std::uint32_t ProgressMeter::Unfinished() const {
  std::uint32_t unfinished = 0;
  for (std::size_t w = 0; w < mPerWorker.size(); ++w) unfinished += mLastHeard[w] != mPerWorker[w] ? 1 : 0;
  return unfinished;
}

void RunWorker(std::uint32_t inIndex, std::uint32_t inCount, WorkBoard& ioBoard,
               std::unique_ptr<DetachingListener> inDoomed, std::chrono::milliseconds inWaitLimit,
               std::string& outError) {
  try {
    PostBursts(inIndex, inCount, ioBoard, inDoomed, inWaitLimit);
    inDoomed.reset();  // a worker with nothing to post still destroys it, here
  } catch (const std::exception& e) {
    outError = "worker " + std::to_string(inIndex) + ": " + e.what();
  }
}

}  // namespace tarn_demo
