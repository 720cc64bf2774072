// Bringing the library up and down: counted Initialize and Terminate, the
// main thread and the well-known stations they set up and take away, posts
// still pending at the end, a second life on another thread, the
// initializer registry, and the station registry at process exit.
#include "StationTestSupport.h"

#include <kivcore/InitializerRegistry.h>
#include <kivcore/PropList.h>

#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <typeinfo>

#ifndef TARN_STATIC_DESTRUCTION_PROBE
#error "TARN_STATIC_DESTRUCTION_PROBE must name the probe program"
#endif

namespace {

using namespace station_test;
namespace Registry = Tarn::StationRegistry;
namespace Utils = Tarn::StationUtils;
using kivcore::config::InitializerRegistry;
using kivcore::threads::CurrentThreadIsMainThread;
using kivcore::threads::GetRegisteredMainThread;
using messaging_test::RecordingListener;

const std::vector<const ImmutableString*>& WellKnownStations() {
  static const std::vector<const ImmutableString*> sStations = {
      &Tarn::kStation_Idle,      &Tarn::kStation_Repeat,      &Tarn::kStation_AppSuspend,
      &Tarn::kStation_AppResume, &Tarn::kStation_AboutDialog, &Tarn::kStation_DirectoryChange,
      &Tarn::kStation_PanicSave, &Tarn::kStation_StatusBar,   &Tarn::kStation_ColorPicker,
      &Tarn::kStation_LocateClip};
  return sStations;
}

// Each test starts and ends with the library not initialized, no main thread
// registered, an empty registry and an empty main-thread queue.
class MessagingLifecycleTest : public ::testing::Test {
protected:
  void SetUp() override {
    ASSERT_FALSE(GetRegisteredMainThread()) << "a main thread is still registered";
    ASSERT_EQ(Registry::FindStation(Tarn::kStation_Idle), nullptr) << "the library is still initialized";
  }

  void TearDown() override {
    if (mRegistryInitialized) InitializerRegistry::TerminateAll();
    while (mInitialized > 0) Terminate();
    Registry::Terminate();
    auto adaptor = kivcore::threads::RegisterCurrentThreadAsMainThread();
    EXPECT_EQ(adaptor->PendingCallCount(), 0u) << "calls left queued for the main thread";
    while (adaptor->PendingCallCount() != 0) adaptor->RunPendingCalls();
    adaptor.reset();
    EXPECT_EQ(TrackedNote::Live(), 0) << "a posted copy was never freed";
  }

  // Counted here, so that TearDown balances whatever a test left.
  void Initialize() {
    Tarn::Messaging::Initialize();
    ++mInitialized;
  }
  void Terminate() {
    --mInitialized;
    Tarn::Messaging::Terminate();
  }

  int mInitialized = 0;
  bool mRegistryInitialized = false;
};

// ---------------------------------------------------------------------------
// Initialize and Terminate

TEST_F(MessagingLifecycleTest, WellKnownStationsDoNotExistBeforeInitialization) {
  RecordingListener listener("listener");
  for (const ImmutableString* id : WellKnownStations()) {
    Utils::AddListener(*id, &listener);
    EXPECT_FALSE(Utils::HasListeners(*id)) << id->c_str();
    EXPECT_EQ(Registry::FindStation(*id), nullptr) << id->c_str();
  }
  EXPECT_FALSE(CurrentThreadIsMainThread());
}

TEST_F(MessagingLifecycleTest, InitializeMakesThisTheMainThreadAndRegistersTheTenWellKnownStations) {
  Initialize();
  EXPECT_TRUE(CurrentThreadIsMainThread());
  EXPECT_TRUE(GetRegisteredMainThread());
  for (const ImmutableString* id : WellKnownStations()) {
    Tarn::Station* station = Registry::FindStation(*id);
    ASSERT_NE(station, nullptr) << id->c_str();
    EXPECT_EQ(typeid(*station), typeid(Tarn::Station)) << id->c_str();
    EXPECT_EQ(station->GetStationID(), *id);
  }
  EXPECT_EQ(Registry::FindStation(Tarn::kNoStation), nullptr);
  EXPECT_STREQ(Registry::FindStation(Tarn::kStation_StatusBar)->GetStationID().c_str(), "tarn.app.status.bar");

  Tarn::Station* idle = Registry::FindStation(Tarn::kStation_Idle);
  EXPECT_FALSE(Utils::HasListeners(Tarn::kStation_Idle));
  EXPECT_EQ(Registry::FindStation(Tarn::kStation_Idle), idle) << "asking for listeners replaced the station";

  Terminate();
  EXPECT_FALSE(Utils::HasListeners(Tarn::kStation_Idle));
  for (const ImmutableString* id : WellKnownStations()) EXPECT_EQ(Registry::FindStation(*id), nullptr) << id->c_str();
  EXPECT_FALSE(CurrentThreadIsMainThread());
  EXPECT_FALSE(GetRegisteredMainThread());
}

TEST_F(MessagingLifecycleTest, SecondInitializeIsCountedAndOnlyTheLastTerminateEndsTheStations) {
  Initialize();
  Initialize();
  Tarn::Station* statusBar = Registry::FindStation(Tarn::kStation_StatusBar);
  RecordingListener listener("listener");
  Utils::AddListener(Tarn::kStation_StatusBar, &listener);

  Terminate();
  EXPECT_EQ(Registry::FindStation(Tarn::kStation_StatusBar), statusBar);
  EXPECT_TRUE(Utils::HasListeners(Tarn::kStation_StatusBar));
  EXPECT_TRUE(CurrentThreadIsMainThread());
  Utils::BroadcastMessage(Tarn::kStation_StatusBar, NumberMessage(1));
  EXPECT_EQ(listener.Calls(), 1);

  Terminate();
  EXPECT_EQ(Registry::FindStation(Tarn::kStation_StatusBar), nullptr);
  EXPECT_FALSE(listener.HasBroadcaster(statusBar));
  EXPECT_FALSE(CurrentThreadIsMainThread());
}

TEST_F(MessagingLifecycleTest, OnlyTheLastTerminateRunsThePendingCallsOnTheCallingThread) {
  Initialize();
  Initialize();
  int runs = 0;
  std::thread::id ranOn;
  kivcore::threads::AsyncCallFromMainThread(
      [&] {
        ++runs;
        ranOn = std::this_thread::get_id();
      },
      0);
  Terminate();
  EXPECT_EQ(runs, 0);
  Terminate();
  EXPECT_EQ(runs, 1);
  EXPECT_EQ(ranOn, std::this_thread::get_id());
}

TEST_F(MessagingLifecycleTest, ForcedAsyncPostPendingAtTheLastTerminateIsNotDeliveredAndIsFreed) {
  const std::size_t blocks = kivcore::utility::SmallBlockAllocator::GetStatistics().blocksInUse;
  Initialize();
  MessageRecorder listener;
  Utils::AddListener(Tarn::kStation_AppSuspend, &listener);
  Utils::PostMessageToUIThread(Tarn::kStation_AppSuspend, TrackedNote(1, std::string(80, 'z')), true);
  EXPECT_EQ(TrackedNote::Live(), 1);

  Terminate();
  EXPECT_EQ(listener.Count(), 0u);
  EXPECT_EQ(TrackedNote::Live(), 0);
  EXPECT_EQ(kivcore::utility::SmallBlockAllocator::GetStatistics().blocksInUse, blocks)
      << "the library kept storage after its last Terminate";
}

TEST_F(MessagingLifecycleTest, InitializeAgainFromAnotherThreadMakesThatThreadTheMainThread) {
  Initialize();
  MessageRecorder oldListener;
  Utils::AddListener(Tarn::kStation_Repeat, &oldListener);
  Terminate();

  MessageRecorder listener;
  Latch initialized;
  Latch posted;
  bool workerIsMain = false;
  bool stationMade = false;
  bool oldListenerCarriedOver = true;
  std::thread::id workerId;
  messaging_test::ThreadGroup worker;
  worker.Start([&] {
    workerId = std::this_thread::get_id();
    Tarn::Messaging::Initialize();
    workerIsMain = CurrentThreadIsMainThread();
    stationMade = Registry::FindStation(Tarn::kStation_Repeat) != nullptr;
    oldListenerCarriedOver = Utils::HasListeners(Tarn::kStation_Repeat);
    Utils::AddListener(Tarn::kStation_Repeat, &listener);
    initialized.CountDown();
    if (posted.WaitFor()) Utils::FlushPostedMessagesOnUIThread();
    Tarn::Messaging::Terminate();
  });

  ASSERT_TRUE(initialized.WaitFor());
  EXPECT_FALSE(CurrentThreadIsMainThread()) << "the old main thread is still the main thread";
  // From here the test's thread is a worker: its post waits for the new main
  // thread, and its broadcast delivers nothing.
  Utils::PostMessageToUIThread(Tarn::kStation_Repeat, NumberMessage(9), false);
  Utils::BroadcastMessage(Tarn::kStation_Repeat, NumberMessage(10));
  posted.CountDown();
  worker.JoinAll();

  EXPECT_TRUE(workerIsMain);
  EXPECT_TRUE(stationMade);
  EXPECT_FALSE(oldListenerCarriedOver) << "a listener of the old station reached the new one";
  EXPECT_EQ(listener.Values(), std::vector<int>{9});
  ASSERT_EQ(listener.Threads().size(), 1u);
  EXPECT_EQ(listener.Threads()[0], workerId);
  EXPECT_EQ(oldListener.Count(), 0u);
  EXPECT_FALSE(GetRegisteredMainThread());
}

// A call queued for the main thread may itself initialize the library; when
// the last Terminate runs it, the library is initialized again and must stay
// usable: with its main thread and its stations.
TEST_F(MessagingLifecycleTest, InitializeRunByTheLastTerminatesPendingCallsLeavesTheLibraryUsable) {
  Initialize();
  kivcore::threads::AsyncCallFromMainThread([this] { Initialize(); }, 0);
  Terminate();
  ASSERT_EQ(mInitialized, 1) << "the queued Initialize did not run";

  EXPECT_NE(Registry::FindStation(Tarn::kStation_Idle), nullptr);
  EXPECT_TRUE(CurrentThreadIsMainThread()) << "initialized again, but without a main thread";
  MessageRecorder listener;
  Utils::AddListener(Tarn::kStation_Idle, &listener);
  RunOnWorker([] { Utils::PostMessageToUIThread(Tarn::kStation_Idle, NumberMessage(1), false); });
  Utils::FlushPostedMessagesOnUIThread();
  EXPECT_EQ(listener.Count(), 1u) << "a post never arrived";
}

// ---------------------------------------------------------------------------
// The initializer registry

TEST_F(MessagingLifecycleTest, LibraryIsEnrolledWithTheInitializerRegistryUnderItsName) {
  unsigned int flags = 0;
  ASSERT_TRUE(InitializerRegistry::IsRegistered("Tarn::Messaging", &flags));
  EXPECT_EQ(flags, 10u);
}

TEST_F(MessagingLifecycleTest, InitializerRegistryBringsTheLibraryUpAndDownCountedWithTheHostsOwnCalls) {
  kivcore::proplist::PropList properties;
  ASSERT_TRUE(InitializerRegistry::InitializeAll(properties));
  mRegistryInitialized = true;
  EXPECT_TRUE(CurrentThreadIsMainThread());
  EXPECT_NE(Registry::FindStation(Tarn::kStation_LocateClip), nullptr);

  Initialize();
  InitializerRegistry::TerminateAll();
  mRegistryInitialized = false;
  EXPECT_NE(Registry::FindStation(Tarn::kStation_LocateClip), nullptr) << "the host's own Initialize was not counted";
  EXPECT_TRUE(CurrentThreadIsMainThread());

  Terminate();
  EXPECT_EQ(Registry::FindStation(Tarn::kStation_LocateClip), nullptr);
  EXPECT_FALSE(CurrentThreadIsMainThread());
}

// ---------------------------------------------------------------------------
// Process exit

struct ProbeResult {
  int mExitCode = -1;
  std::string mOut;
  std::string mErr;
};

std::string ReadFile(const std::string& inPath) {
  std::ifstream file(inPath, std::ios::binary);
  std::ostringstream text;
  text << file.rdbuf();
  return text.str();
}

// Runs the probe program in inMode as a child process and collects its exit
// status and both output streams.
ProbeResult RunProbe(const std::string& inMode) {
  const std::string base =
      (std::filesystem::temp_directory_path() / ("tarn_probe_" + std::to_string(::getpid()) + "_" + inMode)).string();
  const std::string out = base + ".out";
  const std::string err = base + ".err";
  const std::string command =
      std::string("\"") + TARN_STATIC_DESTRUCTION_PROBE + "\" " + inMode + " >\"" + out + "\" 2>\"" + err + "\"";
  const int status = std::system(command.c_str());
  ProbeResult result;
  if (status != -1 && WIFEXITED(status)) result.mExitCode = WEXITSTATUS(status);
  result.mOut = ReadFile(out);
  result.mErr = ReadFile(err);
  std::remove(out.c_str());
  std::remove(err.c_str());
  return result;
}

TEST(StaticDestructionTest, StationOutlivingTheRegistryReportsTheRegistryGoneOnStandardError) {
  const ProbeResult result = RunProbe("late");
  EXPECT_EQ(result.mExitCode, 0);
  EXPECT_EQ(result.mOut, "late station deleted\n");
  EXPECT_EQ(result.mErr, "SERIOUS ERROR!  StationRegistry has already been destructed.\n");
}

TEST(StaticDestructionTest, StationQueuedForDeletionAtExitIsDeletedWhileTheRegistryLives) {
  const ProbeResult result = RunProbe("queued");
  EXPECT_EQ(result.mExitCode, 0);
  EXPECT_EQ(result.mOut, "queued station deleted\n");
  EXPECT_EQ(result.mErr, "");
}

}  // namespace
