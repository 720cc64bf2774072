// Bringing the library down from inside a broadcast, and the station
// registry at process exit.
#include "StationTestSupport.h"

#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>

#ifndef TARN_STATIC_DESTRUCTION_PROBE
#error "TARN_STATIC_DESTRUCTION_PROBE must name the probe program"
#endif

namespace {

using namespace station_test;
namespace Registry = Tarn::StationRegistry;
namespace Utils = Tarn::StationUtils;
using messaging_test::CallLog;
using messaging_test::RecordingListener;

// A "quit" listener ends the library while the station it hears from is
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
  RecordingListener oldest("oldest", &log), leaving("leaving", &log), quit("quit", &log);
  quit.SetAction([&](const Tarn::Message&) { Tarn::Messaging::Terminate(); });
  leaving.SetAction([&](const Tarn::Message&) { Utils::RemoveListener(id, &leaving); });
  oldest.SetAction([&](const Tarn::Message&) {
    EXPECT_EQ(StationLog::Destructions(), 0) << "the station went under its own broadcast";
  });
  for (RecordingListener* listener : {&oldest, &leaving, &quit}) Utils::AddListener(id, listener);
  Utils::BroadcastMessage(id, NumberMessage(1));
  EXPECT_EQ(log.Entries(), (std::vector<std::string>{"quit:1", "leaving:1", "oldest:1"}));
  EXPECT_EQ(StationLog::Destructions(), 1) << "the station outlived its broadcast";
  EXPECT_FALSE(kivcore::threads::CurrentThreadIsMainThread());

  oldest.SetAction(nullptr);
  Tarn::Messaging::Initialize();
  EXPECT_TRUE(kivcore::threads::CurrentThreadIsMainThread());
  Utils::AddListener(Tarn::kStation_StatusBar, &oldest);
  Utils::BroadcastMessage(Tarn::kStation_StatusBar, NumberMessage(2));
  EXPECT_EQ(oldest.Calls(), 2);
  Tarn::Messaging::Terminate();
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
