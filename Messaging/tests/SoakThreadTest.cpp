// Relays made, attached, disposed of and released on workers while the main
// thread broadcasts through them and its handlers delete stations: no
// station is reached half-destroyed or freed under its own broadcast, no
// listener is called after its removal returned, nothing hangs or leaks.
#include "StationTestSupport.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <random>
#include <thread>

namespace {

namespace Registry = Tarn::StationRegistry;
using messaging_test::NumberMessage;
using messaging_test::RecordingListener;

TEST(SoakThreadTest, RelaysComeAndGoOnWorkersWhileTheMainThreadBroadcastsThroughThem) {
  messaging_test::Watchdog watchdog;
  const auto blocksBefore = kivcore::utility::SmallBlockAllocator::GetStatistics().blocksInUse;
  Tarn::Messaging::Initialize();
  std::atomic<int> lateCalls{0}, relayed{0};
  {
    Tarn::Broadcaster source;
    // Reached through a relay: deletes the stations that workers queued,
    // the relay it is called from perhaps among them.
    RecordingListener drainer("drainer");
    drainer.SetAction([&](const Tarn::Message&) {
      relayed.fetch_add(1);
      Registry::DisposeStation(Registry::RegisterUniqueStation());
    });
    std::atomic<bool> stop{false};
    messaging_test::ThreadGroup workers;
    for (int worker = 0; worker < 2; ++worker) {
      workers.Start([&, worker] {
        std::mt19937 random(static_cast<unsigned>(worker) + 11u);
        for (int round = 0; round < 400; ++round) {
          const kivcore::utility::ImmutableString id = Registry::RegisterUniqueStation();
          Tarn::Station* const relay = Registry::RetainStation(id);
          ASSERT_NE(relay, nullptr);
          std::atomic<bool> removed{false};
          RecordingListener own("own");
          own.SetAction([&](const Tarn::Message&) {
            if (removed.load()) lateCalls.fetch_add(1);
          });
          relay->AddListener(&own);
          relay->AddListener(&drainer);
          source.AddListener(relay);
          std::this_thread::sleep_for(std::chrono::microseconds(random() % 200));
          relay->RemoveListener(&own, true);
          removed.store(true);
          if (random() % 2 == 0) {
            Registry::DisposeStation(id);  // pending: the release deletes it here
            Registry::ReleaseStation(id);
          } else {
            Registry::ReleaseStation(id);
            Registry::DisposeStation(id);  // queued for the main thread
          }
        }
      });
    }
    std::thread watcher([&] {
      workers.JoinAll();
      stop.store(true);
    });
    while (!stop.load()) source.BroadcastMessage(NumberMessage(1));
    watcher.join();
    Registry::DisposeStation(Registry::RegisterUniqueStation());
    EXPECT_FALSE(source.HasListeners()) << "a deleted relay is still attached";
  }
  Tarn::Messaging::Terminate();
  EXPECT_EQ(lateCalls.load(), 0) << "a listener was called after its removal returned";
  EXPECT_GT(relayed.load(), 0) << "no broadcast went through a relay";
  EXPECT_EQ(kivcore::utility::SmallBlockAllocator::GetStatistics().blocksInUse, blocksBefore) << "small blocks leaked";
}

}  // namespace
