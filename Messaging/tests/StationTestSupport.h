// Helpers of the station, registry, station-utility, posting and lifecycle
// suites: stations that count their destruction, and a fixture that leaves the process-wide station registry, the main thread and
// the allocator's fault injection as it found them.
//
//   class MyTest : public station_test::RegistryTest {};
//   TEST_F(MyTest, Something) {
//     const auto id = RegisterCounted();           // made on first use
//     Tarn::StationRegistry::FindStation(id);
//     EXPECT_EQ(station_test::StationLog::Destructions(), 0);
//   }
//
// Threading: the counters and logs are locked, so stations may be made and
// destroyed on any thread; the fixture itself runs on the test's thread,
// which it makes the main thread.
#pragma once

#include "TestSupport.h"

#include <TarnMessaging.h>

#include <kivcore/kivcore.h>

#include <cstdint>
#include <optional>
#include <stdexcept>

namespace station_test {

using kivcore::utility::ImmutableString;
using messaging_test::NumberMessage;

// ---------------------------------------------------------------------------
// Stations that count their lives

// Process-wide count of CountedStation destructions. Reset by the fixture.
class StationLog {
public:
  static void Reset() { Destroyed().store(0); }
  static int Destructions() { return Destroyed().load(); }
  static void NoteDestruction() { Destroyed().fetch_add(1); }

private:
  static std::atomic<int>& Destroyed() {
    static std::atomic<int> sDestroyed{0};
    return sDestroyed;
  }
};

// A station that counts its destruction, on whatever thread it runs.
class CountedStation : public Tarn::Station {
public:
  explicit CountedStation(const ImmutableString& inStationID) : Tarn::Station(inStationID) {}
  ~CountedStation() override { StationLog::NoteDestruction(); }
};

inline Tarn::Station* CountingFactory(const ImmutableString& inStationID) { return new CountedStation(inStationID); }

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
