// Helpers of the station, registry, station-utility, posting and lifecycle
// suites: probe messages whose copies are counted, stations that log their
// construction and destruction, a factory that counts, and a
// fixture that leaves the process-wide station registry, the main thread and
// the allocator's fault injection as it found them.
//
//   class MyTest : public station_test::RegistryTest {};
//   TEST_F(MyTest, Something) {
//     const auto id = RegisterCounted();           // made on first use
//     Tarn::StationRegistry::FindStation(id);
//     EXPECT_EQ(station_test::StationLog::Constructions(), 1);
//   }
//
// Threading: the counters and logs are locked, so stations may be made and
// destroyed on any thread; the fixture itself runs on the test's thread,
// which it makes the main thread.
#pragma once

#include "TestSupport.h"

#include <TarnMessaging.h>

#include <kivcore/kivcore.h>

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <mutex>
#include <optional>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

namespace station_test {

using kivcore::utility::ImmutableString;
using messaging_test::kDeadline;
using messaging_test::Latch;
using messaging_test::NumberMessage;

// ---------------------------------------------------------------------------
// Messages

// A message whose live objects are counted, so that a test can tell whether
// the copy a post made has been freed. It also carries a heap-owning text,
// so a shallow copy would show as a corrupted value.
struct TrackedNote : Tarn::MessageImpl<TrackedNote> {
  explicit TrackedNote(int inValue, std::string inText = std::string()) : mValue(inValue), mText(std::move(inText)) {
    sLive.fetch_add(1);
  }
  TrackedNote(const TrackedNote& inOther) : Tarn::MessageImpl<TrackedNote>(inOther), mValue(inOther.mValue), mText(inOther.mText) {
    sLive.fetch_add(1);
  }
  TrackedNote& operator=(const TrackedNote&) = default;
  ~TrackedNote() override { sLive.fetch_sub(1); }

  static int Live() { return sLive.load(); }

  int mValue;
  std::string mText;
  static inline std::atomic<int> sLive{0};
};

// A message from one of several producers, numbered per producer.
struct Sequenced : Tarn::MessageImpl<Sequenced> {
  Sequenced(int inProducer, std::uint32_t inSequence) : mProducer(inProducer), mSequence(inSequence) {}
  int mProducer;
  std::uint32_t mSequence;
};

// ---------------------------------------------------------------------------
// Listeners

// Records every message it hears: the values of NumberMessage and
// TrackedNote (-1 for other types), the
// address of the message object and the thread that delivered it.
class MessageRecorder : public Tarn::Listener {
public:
  void ListenToMessage(const Tarn::Message& inMessage) override {
    std::lock_guard<std::mutex> lock(mMutex);
    if (inMessage.GetMessageID() == NumberMessage::StaticMessageID()) {
      mValues.push_back(static_cast<const NumberMessage&>(inMessage).mValue);
    } else if (inMessage.GetMessageID() == TrackedNote::StaticMessageID()) {
      const auto& note = static_cast<const TrackedNote&>(inMessage);
      mValues.push_back(note.mValue);
      mTexts.push_back(note.mText);
    } else {
      mValues.push_back(-1);
    }
    mAddresses.push_back(&inMessage);
    mThreads.push_back(std::this_thread::get_id());
  }

  std::size_t Count() const {
    std::lock_guard<std::mutex> lock(mMutex);
    return mValues.size();
  }
  std::vector<int> Values() const {
    std::lock_guard<std::mutex> lock(mMutex);
    return mValues;
  }
  std::vector<std::string> Texts() const {
    std::lock_guard<std::mutex> lock(mMutex);
    return mTexts;
  }
  std::vector<const Tarn::Message*> Addresses() const {
    std::lock_guard<std::mutex> lock(mMutex);
    return mAddresses;
  }
  std::vector<std::thread::id> Threads() const {
    std::lock_guard<std::mutex> lock(mMutex);
    return mThreads;
  }

private:
  mutable std::mutex mMutex;
  std::vector<int> mValues;
  std::vector<std::string> mTexts;
  std::vector<const Tarn::Message*> mAddresses;
  std::vector<std::thread::id> mThreads;
};

// ---------------------------------------------------------------------------
// Stations that log their lives

struct Destruction {
  int mSerial;
  std::string mStationID;
  std::thread::id mThread;
};

// Process-wide log of CountedStation constructions and destructions, and of
// factory calls. Reset by the fixture.
class StationLog {
public:
  static void Reset() {
    std::lock_guard<std::mutex> lock(Mutex());
    Constructed() = 0;
    FactoryCalls() = 0;
    Destroyed().clear();
  }
  static int Constructions() {
    std::lock_guard<std::mutex> lock(Mutex());
    return Constructed();
  }
  static int Destructions() {
    std::lock_guard<std::mutex> lock(Mutex());
    return static_cast<int>(Destroyed().size());
  }
  static int Factories() {
    std::lock_guard<std::mutex> lock(Mutex());
    return FactoryCalls();
  }
  static std::vector<Destruction> DestroyedStations() {
    std::lock_guard<std::mutex> lock(Mutex());
    return Destroyed();
  }
  // How often the station with inSerial was destroyed (more than once is a
  // double delete).
  static int TimesDestroyed(int inSerial) {
    int times = 0;
    for (const Destruction& destruction : DestroyedStations()) times += destruction.mSerial == inSerial ? 1 : 0;
    return times;
  }

  // For CountedStation and CountingFactory.
  static int NoteConstruction() {
    std::lock_guard<std::mutex> lock(Mutex());
    return ++Constructed();
  }
  static void NoteDestruction(Destruction inDestruction) {
    std::lock_guard<std::mutex> lock(Mutex());
    Destroyed().push_back(std::move(inDestruction));
  }
  static void NoteFactoryCall() {
    std::lock_guard<std::mutex> lock(Mutex());
    ++FactoryCalls();
  }

private:
  static std::mutex& Mutex() {
    static std::mutex sMutex;
    return sMutex;
  }
  static int& Constructed() {
    static int sConstructed = 0;
    return sConstructed;
  }
  static int& FactoryCalls() {
    static int sFactoryCalls = 0;
    return sFactoryCalls;
  }
  static std::vector<Destruction>& Destroyed() {
    static std::vector<Destruction> sDestroyed;
    return sDestroyed;
  }
};

// A station that numbers itself (1, 2, ... since the last reset) and logs
// its destruction, with the thread it ran on. An optional action runs at the
// start of the destructor (a station that disposes of another, say).
class CountedStation : public Tarn::Station {
public:
  explicit CountedStation(const ImmutableString& inStationID)
      : Tarn::Station(inStationID), mSerial(StationLog::NoteConstruction()) {}
  ~CountedStation() override {
    if (mOnDestroy) mOnDestroy();
    StationLog::NoteDestruction(Destruction{mSerial, GetStationID().c_str(), std::this_thread::get_id()});
  }
  int Serial() const { return mSerial; }
  void OnDestroy(std::function<void()> inAction) { mOnDestroy = std::move(inAction); }

private:
  const int mSerial;
  std::function<void()> mOnDestroy;
};

// Makes a CountedStation and counts the call.
inline Tarn::Station* CountingFactory(const ImmutableString& inStationID) {
  StationLog::NoteFactoryCall();
  return new CountedStation(inStationID);
}

// The serial of a station made by CountingFactory or handed over as a
// CountedStation; 0 for any other station or null.
inline int SerialOf(Tarn::Station* inStation) {
  const auto* counted = dynamic_cast<CountedStation*>(inStation);
  return counted != nullptr ? counted->Serial() : 0;
}

// Runs inBody on a new thread and returns when it has finished; a worker
// still running after the deadline stops the process, naming the test.
inline void RunOnWorker(std::function<void()> inBody) {
  messaging_test::ThreadGroup worker;
  worker.Start(std::move(inBody));
  worker.JoinAll();
}

// ---------------------------------------------------------------------------
// Fixture

// Makes the test's thread the main thread; at the end deletes every station
// (the registry's and those queued by disposals on other threads), runs what
// is left in the main thread's queue, and restores the allocator's fault
// injection.
class RegistryTest : public ::testing::Test {
protected:
  void SetUp() override {
    kivcore::utility::SmallBlockAllocator::SetFailAfter(-1);
    mMainThread.emplace();
    StationLog::Reset();
  }

  void TearDown() override {
    kivcore::utility::SmallBlockAllocator::SetFailAfter(-1);
    // A test may have moved the main thread elsewhere or dropped it.
    mMainThread.reset();
    mMainThread.emplace();
    DrainPendingStations();
    Tarn::StationRegistry::Terminate();
    for (int round = 0; round < 100 && Adaptor().PendingCallCount() != 0; ++round) {
      try {
        Adaptor().RunPendingCalls();
      } catch (...) {
      }
    }
    EXPECT_EQ(Adaptor().PendingCallCount(), 0u) << "calls still queued for the main thread";
    mMainThread.reset();
  }

  kivcore::threads::AsyncEventLoopAdaptor& Adaptor() const { return mMainThread->Adaptor(); }

  // A new ID registered with CountingFactory.
  static ImmutableString RegisterCounted() {
    const ImmutableString id = Tarn::StationRegistry::UniqueStationID();
    Tarn::StationRegistry::RegisterStation(id, &CountingFactory);
    return id;
  }

  // A new ID registered with CountingFactory whose station is made now.
  static ImmutableString MakeCounted() {
    const ImmutableString id = RegisterCounted();
    EXPECT_NE(Tarn::StationRegistry::FindStation(id), nullptr);
    return id;
  }

  // The CountedStation registered under inStationID (made now if need be).
  static CountedStation* Counted(const ImmutableString& inStationID) {
    return dynamic_cast<CountedStation*>(Tarn::StationRegistry::FindStation(inStationID));
  }

  // Deletes the stations queued by disposals on other threads: a main-thread
  // disposal that removes a record does so, even when the record has no
  // station. Call on the main thread.
  static void DrainPendingStations() {
    const ImmutableString id = Tarn::StationRegistry::UniqueStationID();
    Tarn::StationRegistry::RegisterStation(id, nullptr);
    Tarn::StationRegistry::DisposeStation(id);
  }

  std::optional<messaging_test::MainThreadGuard> mMainThread;
};

}  // namespace station_test
