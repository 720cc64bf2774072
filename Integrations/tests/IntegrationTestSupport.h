// Shared pieces of the event-loop integration tests: a numbered message, a
// listener that checks what it hears (each message exactly once, on the loop
// thread, in each worker's order), the shared bounded-wait helpers, and
// a fixture that brings the messaging library up on the test's thread.
//
// Threading: DeliveryLog may be called from any thread (a delivery on the
// wrong thread is exactly what it must record safely). WorkerGroup::JoinAll
// aborts the test process, naming the test, when workers are still running
// after the deadline, so that a deadlock fails instead of hanging.
#pragma once

#include <TarnMessaging.h>

#include <kivcore/Error.h>
#include <kivcore/MainThread.h>

#include <gtest/gtest.h>

#include "BoundedWait.h"

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <exception>
#include <functional>
#include <mutex>
#include <thread>
#include <vector>

namespace integration_test {

using tarn_test::kDeadline;
using tarn_test::Watchdog;
using WorkerGroup = tarn_test::ThreadGroup;


struct Numbered : Tarn::MessageImpl<Numbered> {
  Numbered(int inWorker, int inSequence) : mWorker(inWorker), mSequence(inSequence) {}
  int mWorker;
  int mSequence;
};

// Hears Numbered messages from inWorkers workers posting inPerWorker each.
class DeliveryLog : public Tarn::Listener {
public:
  DeliveryLog(int inWorkers, int inPerWorker)
      : mPerWorker(inPerWorker),
        mLoopThread(std::this_thread::get_id()),
        mCounts(static_cast<std::size_t>(inWorkers * inPerWorker), 0),
        mLastSequence(static_cast<std::size_t>(inWorkers), -1) {}

  // Called on the delivering thread after each delivery, with the total so far.
  void OnDelivery(std::function<void(int)> inCallback) { mOnDelivery = std::move(inCallback); }

  void ListenToMessage(const Tarn::Message& inMessage) override {
    if (inMessage.GetMessageID() != Numbered::StaticMessageID()) return;
    const auto& message = static_cast<const Numbered&>(inMessage);
    int total = 0;
    {
      std::lock_guard<std::mutex> lock(mMutex);
      if (std::this_thread::get_id() != mLoopThread) ++mOffLoopThread;
      const std::size_t worker = static_cast<std::size_t>(message.mWorker);
      if (message.mSequence <= mLastSequence.at(worker)) ++mOutOfOrder;
      mLastSequence[worker] = message.mSequence;
      ++mCounts.at(worker * static_cast<std::size_t>(mPerWorker) + static_cast<std::size_t>(message.mSequence));
      total = ++mTotal;
    }
    if (mOnDelivery) mOnDelivery(total);
  }

  int Total() const {
    std::lock_guard<std::mutex> lock(mMutex);
    return mTotal;
  }
  int OffLoopThread() const {
    std::lock_guard<std::mutex> lock(mMutex);
    return mOffLoopThread;
  }
  int OutOfOrder() const {
    std::lock_guard<std::mutex> lock(mMutex);
    return mOutOfOrder;
  }
  // Messages heard other than exactly once (never, or more than once).
  int NotExactlyOnce() const {
    std::lock_guard<std::mutex> lock(mMutex);
    int wrong = 0;
    for (int count : mCounts)
      if (count != 1) ++wrong;
    return wrong;
  }

private:
  const int mPerWorker;
  const std::thread::id mLoopThread;  // the constructing thread, which runs the loop
  std::function<void(int)> mOnDelivery;
  mutable std::mutex mMutex;
  std::vector<int> mCounts;        // guarded by mMutex; deliveries per (worker, sequence)
  std::vector<int> mLastSequence;  // guarded by mMutex; per worker
  int mTotal = 0;                  // guarded by mMutex
  int mOffLoopThread = 0;          // guarded by mMutex
  int mOutOfOrder = 0;             // guarded by mMutex
};

// Posts inCount Numbered messages of worker inWorker to inStation.
inline void PostNumbered(const kivcore::utility::ImmutableString& inStation, int inWorker, int inFirst, int inCount) {
  for (int i = inFirst; i < inFirst + inCount; ++i)
    Tarn::StationUtils::PostMessageToUIThread(inStation, Numbered(inWorker, i), false);
}

// Forwards each Numbered message it hears, renumbered, as a new asynchronous
// post from inside the handler: each post is queued while a run is in
// progress. Calls mOnLastHop when the last hop is heard.
class Relay : public Tarn::Listener {
public:
  Relay(const kivcore::utility::ImmutableString& inStation, int inHops) : mStation(inStation), mHops(inHops) {}
  void ListenToMessage(const Tarn::Message& inMessage) override {
    if (inMessage.GetMessageID() != Numbered::StaticMessageID()) return;
    const int hop = static_cast<const Numbered&>(inMessage).mSequence;
    mHeard.push_back(hop);
    if (hop + 1 < mHops) Tarn::StationUtils::PostMessageToUIThread(mStation, Numbered(0, hop + 1), true);
    else if (mOnLastHop) mOnLastHop();
  }
  kivcore::utility::ImmutableString mStation;
  const int mHops;
  std::function<void()> mOnLastHop;
  std::vector<int> mHeard;  // main thread only
};

// Records the exceptions that kivcore's error manager is handed, instead of
// printing them; restores the previous handler when it goes.
class ExceptionRecorder {
public:
  ExceptionRecorder()
      : mPrevious(kivcore::config::ErrorManager::SetExceptionHandler([this](std::exception_ptr inException) {
          std::lock_guard<std::mutex> lock(mMutex);
          mExceptions.push_back(inException);
        })) {}
  ~ExceptionRecorder() { kivcore::config::ErrorManager::SetExceptionHandler(std::move(mPrevious)); }
  ExceptionRecorder(const ExceptionRecorder&) = delete;
  ExceptionRecorder& operator=(const ExceptionRecorder&) = delete;

  std::size_t Count() const {
    std::lock_guard<std::mutex> lock(mMutex);
    return mExceptions.size();
  }

private:
  kivcore::config::ErrorManager::ExceptionHandler mPrevious;
  mutable std::mutex mMutex;
  std::vector<std::exception_ptr> mExceptions;  // guarded by mMutex
};

// The test's thread is the main thread for the length of the test, each test
// has a station of its own, and a watchdog ends a test that hangs.
class MessagingTest : public ::testing::Test {
protected:
  void SetUp() override {
    ASSERT_FALSE(kivcore::threads::GetRegisteredMainThread()) << "a main thread is still registered";
    Tarn::Messaging::Initialize();
    mStation = Tarn::StationRegistry::RegisterUniqueStation();
  }
  void TearDown() override { Tarn::Messaging::Terminate(); }

  Watchdog mWatchdog;

  std::size_t PendingCalls() const { return kivcore::threads::GetRegisteredMainThread()->PendingCallCount(); }

  kivcore::utility::ImmutableString mStation;
};

}  // namespace integration_test
