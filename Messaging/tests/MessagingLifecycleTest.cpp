// Bringing the library down from inside a broadcast, and the station
// registry at process exit.
#include "DiagnosticsTestSupport.h"
#include "StationTestSupport.h"

#include <TarnMessaging/Tracing.h>

#include <kivcore/InitializerRegistry.h>

#include <sys/wait.h>

#ifndef TARN_STATIC_DESTRUCTION_PROBE
#error "TARN_STATIC_DESTRUCTION_PROBE must name the probe program"
#endif

namespace {

using namespace station_test;
namespace Registry = Tarn::StationRegistry;
namespace Utils = Tarn::StationUtils;
using namespace messaging_test;

// A "quit" subscription ends the library while the station it hears from is
// broadcasting: the station once went at once (use after free), a later
// handler removing itself, its thread no longer the main thread, waited for
// its own delivery for ever, and the quit handler, resetting its own
// subscription, was freed under itself. Another thread then becomes the main
// thread and is about to relay through the station (a listener of a
// broadcaster) as the broadcast ends and deletes it: the deletion waits for
// the relay, whose end looks for retired stations; made under the
// registry's lock, it waited for ever.
TEST(MessagingLifecycleTest, TerminateFromAHandlerLetsTheBroadcastFinishAndTheLibraryComeBack) {
  messaging_test::Watchdog watchdog;
  StationLog::Reset();
  Tarn::Messaging::Initialize();
  static messaging_test::Latch sAboutToRelay, sDeleting;
  struct GatedStation : CountedStation {
    using CountedStation::CountedStation;
    void ListenToMessage(const Tarn::Message& inMessage) override {
      sAboutToRelay.CountDown();
      EXPECT_TRUE(sDeleting.WaitFor());
      CountedStation::ListenToMessage(inMessage);
    }
  };
  const ImmutableString id = Registry::UniqueStationID();
  Registry::RegisterStation(id, [](const ImmutableString& inID) -> Tarn::Station* { return new GatedStation(inID); });
  Tarn::Station* const station = Registry::FindStation(id);
  Tarn::Broadcaster broadcaster;
  broadcaster.AddListener(station);
  const auto handler = kivcore::config::SetErrorHandler([](const kivcore::config::ErrorReport& inReport) {
    if (inReport.key.rfind(Tarn::Tracing::kRemovalWaitKey, 0) == 0) sDeleting.CountDown();
  });
  const auto threshold = Tarn::Tracing::SetRemovalWaitReport(std::chrono::milliseconds(1));
  CallLog log;
  RecordingListener oldest("oldest", &log), leaving("leaving", &log);
  leaving.SetAction([&](const Tarn::Message&) { station->RemoveListener(&leaving, true); });
  oldest.SetAction([&](const Tarn::Message&) {
    EXPECT_EQ(StationLog::Destructions(), 0) << "the station went under its own broadcast";
  });
  for (RecordingListener* listener : {&oldest, &leaving}) Utils::AddListener(id, listener);
  messaging_test::ThreadGroup mover;
  Tarn::Registration quit;
  quit = Tarn::Subscribe<NumberMessage>(id, [&, name = std::string("quit")](const NumberMessage& inMessage) {
    Tarn::Messaging::Terminate();
    quit.Reset();
    log.Add(name + ":" + std::to_string(inMessage.mValue));
    mover.Start([&] {
      Tarn::Messaging::Initialize();
      broadcaster.BroadcastMessage(NumberMessage(2));
      Tarn::Messaging::Terminate();
    });
    EXPECT_TRUE(sAboutToRelay.WaitFor());
  });
  station->BroadcastMessage(NumberMessage(1));
  mover.JoinAll();
  Tarn::Tracing::SetRemovalWaitReport(threshold);
  kivcore::config::SetErrorHandler(handler);
  EXPECT_EQ(log.Entries(), (std::vector<std::string>{"quit:1", "leaving:1", "oldest:1", "oldest:2"}));
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
// another thread meanwhile, and goes as the call lets it go: here a
// main-thread broadcast by ID while a worker terminates before the broadcast
// has begun (a worker's call while the main thread terminates once freed the
// station the same way). Terminate also keeps the room it made for the
// stations it retires while the host's error handler, reporting leftovers,
// uses up the spare room. The library comes up and goes down with the host's
// initializer registry.
TEST(MessagingLifecycleTest, AStationACallHoldsOutlivesTerminateAndGoesWithTheCall) {
  StationLog::Reset();
  ASSERT_TRUE(kivcore::config::InitializerRegistry::InitializeAll(kivcore::proplist::PropList()));
  struct SlowStation : CountedStation {
    using CountedStation::CountedStation;
    void BroadcastMessage(const Tarn::Message& inMessage) override {
      RunOnWorker([] { Registry::Terminate(); });
      CountedStation::BroadcastMessage(inMessage);
    }
  };
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

// One Terminate too many is refused: it once left a count below zero, and
// the next Initialize then brought nothing up.
TEST(MessagingLifecycleTest, ATerminateWithoutInitializeIsReportedAndChangesNothing) {
  messaging_test::ContractDialogRecorder dialog;
  messaging_test::ErrorRecorder errors;
  Tarn::Messaging::Terminate();
  EXPECT_EQ(dialog.Count(), 1u);
  Tarn::Messaging::Initialize();
  EXPECT_NE(Registry::FindStation(Tarn::kStation_StatusBar), nullptr);
  Tarn::Messaging::Terminate();
  EXPECT_EQ(Registry::FindStation(Tarn::kStation_StatusBar), nullptr);
}

// ---------------------------------------------------------------------------
// Process exit

// A station queued by a disposal while no main thread is registered waits
// in the registry's pending list until exit, and goes while the registry is
// still alive, without a diagnostic. A lookup made after the registry's own
// static destruction finds nothing and says why, instead of reading the
// destroyed map. A forgotten Terminate with a post still queued is reported.
// The last Terminate made by a static object's destructor reports what it
// leaves behind, naming no violation whose dialog threw.
TEST(StaticDestructionTest, StationsAtExitGoWhileTheRegistryLivesAndLateLookupsFindNothing) {
  // The probe's output in inMode; it must exit normally with status 0.
  auto run = [](const char* inMode) {
    std::string output;
    FILE* const probe = ::popen((std::string("\"") + TARN_STATIC_DESTRUCTION_PROBE + "\" " + inMode + " 2>&1").c_str(), "r");
    char buffer[256];
    while (probe != nullptr && std::fgets(buffer, sizeof buffer, probe) != nullptr) output += buffer;
    const int status = probe != nullptr ? ::pclose(probe) : -1;
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << inMode << ": " << status << output;
    return output;
  };
  const std::string unterminated = run("unterminated"), queued = run("queued"), late = run("late");
  EXPECT_NE(unterminated.find("Tarn::Messaging::Terminate was not made before the process exited: 1 "), std::string::npos) << unterminated;
  EXPECT_EQ(queued, "queued station deleted\n");
  EXPECT_NE(late.find("SERIOUS ERROR!  StationRegistry has already been destructed.\nlate lookup found nothing\n"), std::string::npos) << late;
  const std::string violation = run("violation");
  EXPECT_EQ(0u, violation.find("the dialog threw\nTarnMessaging: ")) << violation;
  EXPECT_NE(violation.find("still retained"), std::string::npos) << violation;
  EXPECT_EQ(violation.find("inListener"), std::string::npos) << "a thrown-away violation named: " << violation;
}

}  // namespace
