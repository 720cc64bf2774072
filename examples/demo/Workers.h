// The workers of tarn-demo and what they share with the main thread.
//
//   WorkBoard board(workers);
//   std::thread worker(RunWorker, 0, count, std::ref(board), std::move(doomed), limit, std::ref(error));
//   ... main thread: board.NoteHandled(n) after each run of pending calls,
//       board.OpenBurst(b) after each burst's autosave ...
//   worker.join();
//
// Each worker does kBursts bursts of simulated work and posts a
// ProgressMessage to kStation_StatusBar after each unit of it. Between two
// bursts it waits until the main thread opens the next one. Beside that
// exact stream, each unit also updates the worker's progress meter with a
// coalesced post: the main thread hears only the newest update a worker made
// before each of its runs, however many were posted.
//
// Threading: WorkBoard may be used from any thread; the functions marked
// "main thread" or "worker" say who calls them.
#pragma once

#include "DemoListeners.h"

#include <TarnMessaging.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

namespace tarn_demo {

constexpr std::uint32_t kBursts = 3;

// What the main thread and the workers share: which burst of work may run,
// how many posts have been made and handled, and which bursts the workers
// have finished.
//
// Flow control: a worker posts only while fewer than kMaxInFlight of all
// posts wait for the main thread; otherwise it waits until the backlog is
// down to half that. Without it the workers outrun the main thread and the
// latency figures measure nothing but the length of the queue.
class WorkBoard {
public:
  static constexpr std::uint64_t kMaxInFlight = 1000;

  // inMeterStation: where the workers' coalesced meter updates go.
  WorkBoard(std::uint32_t inWorkers, const Tarn::StationUtils::ImmutableString& inMeterStation)
      : mWorkers(inWorkers), mMeterStation(inMeterStation) {}

  const Tarn::StationUtils::ImmutableString& MeterStation() const { return mMeterStation; }

  // Worker: blocks while the main thread is kMaxInFlight posts behind. False
  // when the run was abandoned or inLimit passed first.
  bool WaitForRoom(std::chrono::milliseconds inLimit) {
    if (Backlog() < kMaxInFlight) return true;
    std::unique_lock<std::mutex> lock(mMutex);
    // Counted before the backlog is read again, and the main thread reads the
    // count after storing its progress: one of the two sees the other.
    mWaitingForRoom.fetch_add(1);
    const bool room =
        mChanged.wait_for(lock, inLimit, [&] { return mAbandoned || Backlog() <= kMaxInFlight / 2; }) && !mAbandoned;
    mWaitingForRoom.fetch_sub(1);
    return room;
  }
  // Main thread: inHandled posts have been delivered or dropped so far.
  void NoteHandled(std::uint64_t inHandled) {
    mHandled.store(inHandled);
    if (mWaitingForRoom.load() == 0) return;
    // Taken so that a worker between its check and its wait cannot miss this.
    { std::lock_guard<std::mutex> lock(mMutex); }
    mChanged.notify_all();
  }

  // Worker: blocks until burst inBurst is opened. False when the run was
  // abandoned or inLimit passed first.
  bool WaitForBurst(std::uint32_t inBurst, std::chrono::milliseconds inLimit) {
    std::unique_lock<std::mutex> lock(mMutex);
    return mChanged.wait_for(lock, inLimit, [&] { return mAbandoned || mOpenBurst >= inBurst; }) && !mAbandoned;
  }
  // Main thread: lets the workers start burst inBurst.
  void OpenBurst(std::uint32_t inBurst) {
    {
      std::lock_guard<std::mutex> lock(mMutex);
      mOpenBurst = inBurst;
    }
    mChanged.notify_all();
  }
  // Main thread: releases every waiting worker for good.
  void Abandon() {
    {
      std::lock_guard<std::mutex> lock(mMutex);
      mAbandoned = true;
    }
    mChanged.notify_all();
  }

  // Worker: counted after the post has returned.
  void NotePosted() { mPosted.fetch_add(1); }
  std::uint64_t Posted() const { return mPosted.load(); }
  // Worker: counted after a coalesced meter update has returned.
  void NoteMeterPosted() { mMeterPosted.fetch_add(1, std::memory_order_relaxed); }
  std::uint64_t MeterPosted() const { return mMeterPosted.load(); }

  void NoteBurstFinished() { mBurstsFinished.fetch_add(1, std::memory_order_acq_rel); }
  bool BurstFinishedByAll(std::uint32_t inBurst) const {
    return mBurstsFinished.load(std::memory_order_acquire) >= std::uint64_t{mWorkers} * (inBurst + 1);
  }

private:
  // Posts not yet delivered or dropped. A library that delivered a message
  // twice could make the handled count overtake the posts; that shows in
  // the summary, not as a huge backlog here.
  std::uint64_t Backlog() const {
    const std::uint64_t handled = mHandled.load();
    const std::uint64_t posted = mPosted.load();
    return posted > handled ? posted - handled : 0;
  }

  const std::uint32_t mWorkers;
  const Tarn::StationUtils::ImmutableString mMeterStation;
  std::mutex mMutex;
  std::condition_variable mChanged;
  std::uint32_t mOpenBurst = 0;  // guarded by mMutex
  bool mAbandoned = false;       // guarded by mMutex
  std::atomic<std::uint64_t> mPosted{0};
  std::atomic<std::uint64_t> mMeterPosted{0};
  std::atomic<std::uint64_t> mHandled{0};         // written by the main thread
  std::atomic<int> mWaitingForRoom{0};            // workers in WaitForRoom
  std::atomic<std::uint64_t> mBurstsFinished{0};  // one count per worker and burst
};

// A worker's newest count of units done, posted coalesced (keyed by worker).
struct MeterMessage : Tarn::MessageImpl<MeterMessage> {
  MeterMessage(std::uint32_t inWorker, std::uint32_t inDone) : mWorker(inWorker), mDone(inDone) {}
  std::uint32_t mWorker;
  std::uint32_t mDone;  // 1, 2, ... up to the worker's count
};

// The progress meter: listens on a private station to the workers' coalesced
// updates and checks what coalescing promises: each worker's updates arrive
// newest-so-far only (never an older or the same one again), and the last
// one arrives. Main thread only, like its deliveries.
class ProgressMeter : public Tarn::Listener {
public:
  // inPerWorker[w]: the units worker w does.
  explicit ProgressMeter(const std::vector<std::uint32_t>& inPerWorker);
  ~ProgressMeter() override;
  ProgressMeter(const ProgressMeter&) = delete;
  ProgressMeter& operator=(const ProgressMeter&) = delete;

  void ListenToMessage(const Tarn::Message& inMessage) override;

  const Tarn::StationUtils::ImmutableString& StationID() const { return mStationID; }
  std::uint64_t Delivered() const { return mDelivered; }
  // Updates that were not newer than the one before from the same worker.
  std::uint64_t Regressions() const { return mRegressions; }
  // Workers whose last update heard is not their last unit.
  std::uint32_t Unfinished() const;

private:
  const std::vector<std::uint32_t> mPerWorker;
  const Tarn::StationUtils::ImmutableString mStationID;
  std::vector<std::uint32_t> mLastHeard;  // by worker; 0 before the first update
  std::uint64_t mDelivered = 0;
  std::uint64_t mRegressions = 0;
};

// The body of worker inIndex, which posts inCount messages. The worker that
// is handed inDoomed destroys it a quarter of the way through its messages,
// while a delivery to it is running on the main thread (the removal must
// then wait for that delivery). A wait that lasts longer than inWaitLimit
// ends the worker early. An exception is caught and described in outError.
void RunWorker(std::uint32_t inIndex, std::uint32_t inCount, WorkBoard& ioBoard,
               std::unique_ptr<DetachingListener> inDoomed, std::chrono::milliseconds inWaitLimit,
               std::string& outError);

}  // namespace tarn_demo
