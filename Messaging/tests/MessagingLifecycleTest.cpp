// Bringing the library down from inside a broadcast, and the station
// registry at process exit.
#include "DiagnosticsTestSupport.h"
#include "StationTestSupport.h"

#include <TarnMessaging/Tracing.h>

#include <kivcore/InitializerRegistry.h>
#include <kivcore/SmallBlockAllocator.h>

#include <sys/wait.h>

#include <cstdio>
#include <string>

#ifndef TARN_STATIC_DESTRUCTION_PROBE
#error "TARN_STATIC_DESTRUCTION_PROBE must name the probe program"
#endif

namespace {

using namespace station_test;
namespace Registry = Tarn::StationRegistry;
namespace Utils = Tarn::StationUtils;
using messaging_test::CallLog;
using messaging_test::RecordingListener;

// A "quit" subscription ends the library while the station it hears from is
// broadcasting: the station once went at once (use after free), and a later
// handler removing itself, its thread no longer the main thread, waited for
// its own delivery for ever.
TEST(MessagingLifecycleTest, TerminateFromAHandlerLetsTheBroadcastFinishAndTheLibraryComeBack) {
  messaging_test::Watchdog watchdog;
  StationLog::Reset();
  Tarn::Messaging::Initialize();
  const ImmutableString id = Registry::UniqueStationID();
  Registry::RegisterStation(id, &CountingFactory);
  CallLog log;
  RecordingListener oldest("oldest", &log), leaving("leaving", &log);
  leaving.SetAction([&](const Tarn::Message&) { Utils::RemoveListener(id, &leaving); });
  oldest.SetAction([&](const Tarn::Message&) {
    EXPECT_EQ(StationLog::Destructions(), 0) << "the station went under its own broadcast";
  });
  for (RecordingListener* listener : {&oldest, &leaving}) Utils::AddListener(id, listener);
  // Its thread no longer the main thread, the handler resets its own
  // subscription and then uses what it captured: freed only as it returns.
  Tarn::Registration quit;
  quit = Tarn::Subscribe<NumberMessage>(id, [&, name = std::string("quit")](const NumberMessage& inMessage) {
    Tarn::Messaging::Terminate();
    quit.Reset();
    log.Record(name + ":" + std::to_string(inMessage.mValue));
  });
  Utils::BroadcastMessage(id, NumberMessage(1));
  EXPECT_EQ(log.Entries(), (std::vector<std::string>{"quit:1", "leaving:1", "oldest:1"}));
  EXPECT_EQ(StationLog::Destructions(), 1) << "the station outlived its broadcast";
  EXPECT_FALSE(kivcore::threads::CurrentThreadIsMainThread());

  Tarn::Messaging::Initialize();
  EXPECT_TRUE(kivcore::threads::CurrentThreadIsMainThread()) << "the library did not come back";

  // A handler may also bring the library back at once and make the new
  // well-known station: the broadcast's hold on the old one must not be
  // released on the new one (its count would wrap and it could never go).
  RecordingListener restart("restart", &log), newcomer("newcomer", &log);
  restart.SetAction([&](const Tarn::Message&) {
    Tarn::Messaging::Terminate();
    Tarn::Messaging::Initialize();
    Utils::AddListener(Tarn::kStation_Idle, &newcomer);
  });
  Utils::AddListener(Tarn::kStation_Idle, &restart);
  Utils::BroadcastMessage(Tarn::kStation_Idle, NumberMessage(2));
  Registry::DisposeStation(Tarn::kStation_Idle);
  EXPECT_EQ(Registry::FindStation(Tarn::kStation_Idle), nullptr) << "the new station is held by a retain it never had";
  Tarn::Messaging::Terminate();
}

// A station that a running call holds outlives the last Terminate made on
// another thread meanwhile, and goes as the call lets it go: a worker's call
// while the main thread terminates and initializes again; a main-thread
// broadcast by ID while a worker terminates before the broadcast has begun.
// Terminate also keeps the room it made for the stations it retires while
// the host's error handler, reporting leftovers, uses up the spare room.
TEST(MessagingLifecycleTest, AStationACallHoldsOutlivesTerminateAndGoesWithTheCall) {
  messaging_test::Watchdog watchdog;
  Tarn::Messaging::Initialize();
  messaging_test::Latch inCall, restarted;
  const messaging_test::ErrorRecorder contractErrors;
  const auto previous = kivcore::debug::SetContractDialogHandler([&](const char*, const char*, const char*, int) {
    inCall.CountDown();
    EXPECT_TRUE(restarted.WaitFor());
    return false;
  });
  messaging_test::ThreadGroup worker;
  worker.Start([] { Utils::AddListener(Tarn::kStation_StatusBar, std::weak_ptr<Tarn::Listener>()); });
  EXPECT_TRUE(inCall.WaitFor());
  Tarn::Messaging::Terminate();
  Tarn::Messaging::Initialize();
  restarted.CountDown();
  worker.JoinAll();
  kivcore::debug::SetContractDialogHandler(previous);

  struct SlowStation : CountedStation {
    using CountedStation::CountedStation;
    void BroadcastMessage(const Tarn::Message& inMessage) override {
      RunOnWorker([] { Registry::Terminate(); });
      CountedStation::BroadcastMessage(inMessage);
    }
  };
  StationLog::Reset();
  const ImmutableString slow = Registry::UniqueStationID();
  Registry::RegisterStation(slow, [](const ImmutableString& inID) -> Tarn::Station* { return new SlowStation(inID); });
  RecordingListener heard("heard");
  Utils::AddListener(slow, &heard);
  Utils::BroadcastMessage(slow, NumberMessage(1));
  EXPECT_EQ(heard.Calls(), 1);
  EXPECT_EQ(StationLog::Destructions(), 1) << "the station outlived the call that held it";

  const messaging_test::SilentFailureReportsSetting reports(Tarn::Diagnostics::SilentFailureReports::kOn);
  const auto handler = kivcore::config::SetErrorHandler([](const kivcore::config::ErrorReport& inReport) {
    if (inReport.key.find("ListenersAtTerminate") == std::string::npos) return;
    Registry::DisposeStation(Registry::RegisterUniqueStation());  // the pending list gives back its spare room
    kivcore::utility::SmallBlockAllocator::SetFailAfter(0);
  });
  const ImmutableString busy = Registry::UniqueStationID();
  Registry::RegisterStation(busy, &CountingFactory);
  RecordingListener quit("quit");
  quit.SetAction([&](const Tarn::Message&) {
    const messaging_test::SmallBlockFailureGuard restore(-1);  // to never again, however Terminate ends
    Registry::Terminate();
  });
  Utils::AddListener(busy, &quit);
  Utils::BroadcastMessage(busy, NumberMessage(2));
  kivcore::config::SetErrorHandler(handler);
  EXPECT_EQ(StationLog::Destructions(), 2) << "the station Terminate retired was lost";
  Tarn::Messaging::Terminate();
}

// A handler's Terminate retires the station it hears from; the main thread
// then moves, and the new one is about to relay through that station (a
// listener of a broadcaster) when the old broadcast ends and deletes it. The
// deletion waits for the relay, which ends by looking for retired stations:
// a deletion made under the registry's lock waited for ever.
TEST(MessagingLifecycleTest, AStationDeletedAfterTheMainThreadMovedWaitsWithoutTheRegistryLock) {
  messaging_test::Watchdog watchdog;
  Tarn::Messaging::Initialize();
  const ImmutableString id = Registry::RegisterUniqueStation();
  Tarn::Station* const station = Registry::FindStation(id);
  Tarn::Broadcaster broadcaster;
  broadcaster.AddListener(station);
  messaging_test::Latch aboutToRelay, deleting;
  struct Gate : Tarn::Tracing::DeliveryTracer {
    Gate(const void* inStation, messaging_test::Latch& ioReached, messaging_test::Latch& ioGo)
        : mStation(inStation), mReached(ioReached), mGo(ioGo) {}
    void DeliveryBegins(const Tarn::Tracing::Delivery& inDelivery) override {
      if (inDelivery.mListener != mStation) return;
      mReached.CountDown();
      EXPECT_TRUE(mGo.WaitFor());
    }
    void DeliveryEnded(const Tarn::Tracing::Delivery&, std::chrono::nanoseconds) override {}
    const void* mStation;
    messaging_test::Latch& mReached;
    messaging_test::Latch& mGo;
  } gate(static_cast<Tarn::Listener*>(station), aboutToRelay, deleting);
  const auto handler = kivcore::config::SetErrorHandler([&](const kivcore::config::ErrorReport& inReport) {
    if (inReport.key.rfind(Tarn::Tracing::kRemovalWaitKey, 0) == 0) deleting.CountDown();
  });
  const auto threshold = Tarn::Tracing::SetRemovalWaitReport(std::chrono::milliseconds(1));
  Tarn::Tracing::SetDeliveryTracer(&gate);
  RecordingListener quit("quit");
  messaging_test::ThreadGroup mover;
  quit.SetAction([&](const Tarn::Message&) {
    if (quit.Calls() != 1) return;
    Tarn::Messaging::Terminate();
    mover.Start([&] {
      Tarn::Messaging::Initialize();
      broadcaster.BroadcastMessage(NumberMessage(2));
      Tarn::Messaging::Terminate();
    });
    EXPECT_TRUE(aboutToRelay.WaitFor());
  });
  station->AddListener(&quit);
  station->BroadcastMessage(NumberMessage(1));
  mover.JoinAll();
  Tarn::Tracing::SetDeliveryTracer(nullptr);
  Tarn::Tracing::SetRemovalWaitReport(threshold);
  kivcore::config::SetErrorHandler(handler);
  EXPECT_EQ(quit.Calls(), 2);
  EXPECT_FALSE(broadcaster.HasListeners());
}

// A host that brings its libraries up through the initializer registry
// brings this one up and down with them.
TEST(MessagingLifecycleTest, TheInitializerRegistryBringsTheLibraryUpAndDown) {
  ASSERT_TRUE(kivcore::config::InitializerRegistry::InitializeAll(kivcore::proplist::PropList()));
  EXPECT_TRUE(kivcore::threads::CurrentThreadIsMainThread());
  kivcore::config::InitializerRegistry::TerminateAll();
  EXPECT_FALSE(kivcore::threads::CurrentThreadIsMainThread());
}

// The library brought up, used (a station made, retired under its own
// broadcast, disposed of; a post left waiting for idle time) and terminated
// gives back every small block it took.
TEST(MessagingLifecycleTest, TerminateGivesBackEverySmallBlock) {
  const auto before = kivcore::utility::SmallBlockAllocator::GetStatistics().blocksInUse;
  Tarn::Messaging::Initialize();
  {
    const ImmutableString id = Registry::RegisterUniqueStation();
    RecordingListener disposer("disposer");
    disposer.SetAction([&](const Tarn::Message&) { Registry::DisposeStation(id); });
    Utils::AddListener(id, &disposer);
    Utils::BroadcastMessage(id, NumberMessage(1));
    EXPECT_EQ(Registry::FindStation(id), nullptr);
    Utils::PostMessageAtIdleTime(Tarn::kStation_Idle, NumberMessage(2));  // waits for an idle broadcast that never comes
  }
  Tarn::Messaging::Terminate();
  EXPECT_EQ(kivcore::utility::SmallBlockAllocator::GetStatistics().blocksInUse, before);
}

// ---------------------------------------------------------------------------
// Process exit

// A station queued by a disposal while no main thread is registered waits
// in the registry's pending list until exit, and goes while the registry is
// still alive, without a diagnostic. A lookup made after the registry's own
// static destruction finds nothing and says why, instead of reading the
// destroyed map.
TEST(StaticDestructionTest, StationsAtExitGoWhileTheRegistryLivesAndLateLookupsFindNothing) {
  auto run = [](const char* inMode, std::string& outOutput) {
    FILE* const probe = ::popen((std::string("\"") + TARN_STATIC_DESTRUCTION_PROBE + "\" " + inMode + " 2>&1").c_str(), "r");
    if (probe == nullptr) return -1;
    char buffer[256];
    while (std::fgets(buffer, sizeof buffer, probe) != nullptr) outOutput += buffer;
    return ::pclose(probe);
  };
  std::string queued, late;
  int status = run("queued", queued);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
  EXPECT_EQ(queued, "queued station deleted\n");
  status = run("late", late);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status << late;
  EXPECT_NE(late.find("SERIOUS ERROR!  StationRegistry has already been destructed.\nlate lookup found nothing\n"),
            std::string::npos)
      << late;
}

}  // namespace
