// tarn-demo --remote: a host and a plug-in in two processes, on stations
// shared through Tarn::Remote. The plug-in (this program again, with
// --remote-plugin) posts progress from a worker thread to its station
// demo.plugin, which the host imports; the host broadcasts a command every
// 20 ms on demo.host, which the plug-in imports and counts. Halfway through
// the first run the host kills the plug-in with SIGKILL and starts it
// again. The summary accounts for every message of each run:
//   posted = delivered + reported lost + lost with the killed process,
// where the last is what the plug-in had posted after the last message that
// left it (read from a counter the two processes share), delivered twice
// must be 0, and so must the silent losses: messages up to the last one
// delivered that were neither delivered nor reported.
#include "RemoteDemo.h"

#include <TarnMessaging.h>
#include <TarnMessaging/Remote/Node.h>
#include <TarnMessaging/Remote/WireMessage.h>

#include <kivcore/MainThread.h>

#include <fcntl.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <thread>

namespace tarn_demo {

struct PluginProgress : Tarn::MessageImpl<PluginProgress> {
  std::int32_t mRun = 0;
  std::uint64_t mNumber = 0;          // 1, 2, ... within the run
  std::uint64_t mHeardFromHost = 0;   // host commands the plug-in heard so far
};
TARN_WIRE_MESSAGE(PluginProgress, "demo.plugin.progress", 1, mRun, mNumber, mHeardFromHost)

struct HostCommand : Tarn::MessageImpl<HostCommand> {
  std::uint64_t mNumber = 0;
};
TARN_WIRE_MESSAGE(HostCommand, "demo.host.command", 1, mNumber)

namespace {

using Clock = std::chrono::steady_clock;
using kivcore::utility::ImmutableString;

constexpr std::uint64_t kMessagesPerRun = 20000;

const ImmutableString& PluginStation() {
  static const ImmutableString sID = ImmutableString::CreateStatic("demo.plugin");
  return sID;
}
const ImmutableString& HostStation() {
  static const ImmutableString sID = ImmutableString::CreateStatic("demo.host");
  return sID;
}

template <class Predicate>
bool RunUntil(Predicate inDone, std::chrono::milliseconds inTimeout) {
  const auto deadline = Clock::now() + inTimeout;
  const auto mainThread = kivcore::threads::GetRegisteredMainThread();
  while (!inDone()) {
    if (Clock::now() >= deadline) return inDone();
    if (mainThread->WaitForPendingCalls(5)) mainThread->RunPendingCalls();
  }
  return true;
}

// The counter the plug-in bumps before each post, in a file both map.
std::atomic<std::uint64_t>* MapCounter(const std::string& inPath, bool inCreate) {
  const int file = ::open(inPath.c_str(), O_RDWR | (inCreate ? O_CREAT | O_TRUNC : 0), 0600);
  if (file < 0 || (inCreate && ::ftruncate(file, sizeof(std::uint64_t)) != 0)) return nullptr;
  void* memory = ::mmap(nullptr, sizeof(std::uint64_t), PROT_READ | PROT_WRITE, MAP_SHARED, file, 0);
  ::close(file);
  return memory == MAP_FAILED ? nullptr : static_cast<std::atomic<std::uint64_t>*>(memory);
}

int RunPlugin(int inRun, const std::string& inOwn, const std::string& inHost, const std::string& inCounter) {
  std::atomic<std::uint64_t>* posted = MapCounter(inCounter, false);
  if (posted == nullptr) return 2;
  Tarn::Remote::NodeOptions options;
  options.mEndpoint = inOwn;
  Tarn::Remote::Node node(options);
  std::uint32_t importers = 0;
  std::atomic<std::uint64_t> heard{0};
  const Tarn::Registration counted = Tarn::Subscribe<Tarn::Remote::ImportersChanged>(
      PluginStation(), [&](const Tarn::Remote::ImportersChanged& inChanged) { importers = inChanged.mImporters; });
  const Tarn::Registration commands =
      Tarn::Subscribe<HostCommand>(HostStation(), [&](const HostCommand&) { heard.fetch_add(1); });
  node.Export(PluginStation());
  node.Import(HostStation(), inHost);
  if (!RunUntil([&] { return importers > 0; }, std::chrono::seconds(10))) return 2;
  std::atomic<bool> done{false};
  std::thread worker([&] {
    for (std::uint64_t number = 1; number <= kMessagesPerRun; ++number) {
      PluginProgress progress;
      progress.mRun = inRun;
      progress.mNumber = number;
      progress.mHeardFromHost = heard.load();
      posted->store(number);
      Tarn::StationUtils::PostMessageToUIThread(PluginStation(), progress, true);
      if (number % 64 == 0) std::this_thread::sleep_for(std::chrono::microseconds(500));
    }
    done = true;
  });
  const bool sent = RunUntil(
      [&] {
        const Tarn::Remote::NodeStats stats = node.GetStats();
        return done && stats.mExported + stats.mExportDropped == kMessagesPerRun;
      },
      std::chrono::seconds(30));
  worker.join();
  return sent ? 0 : 2;
}

struct RunAccount {
  std::uint64_t mPosted = 0;
  std::uint64_t mDelivered = 0;
  std::uint64_t mReportedLost = 0;
  std::uint64_t mLastNumber = 0;
  std::uint64_t mTwice = 0;
  std::uint64_t mHeardFromHost = 0;
};

pid_t StartPlugin(const char* inSelf, int inRun, const std::string& inOwn, const std::string& inHost,
                  const std::string& inCounter) {
  const pid_t pid = ::fork();
  if (pid == 0) {
    const std::string run = std::to_string(inRun);
    ::execl(inSelf, inSelf, "--remote-plugin", run.c_str(), inOwn.c_str(), inHost.c_str(), inCounter.c_str(),
            static_cast<char*>(nullptr));
    ::_exit(127);
  }
  return pid;
}

int RunHost(const char* inSelf) {
  const std::string pid = std::to_string(::getpid());
  const std::string own = Tarn::Remote::Node::DefaultEndpoint("tarn-demo-host-" + pid);
  const std::string plugin = Tarn::Remote::Node::DefaultEndpoint("tarn-demo-plugin-" + pid);
  const std::string counterPath = own.substr(std::strlen("ipc://")) + ".posted";
  std::atomic<std::uint64_t>* posted = MapCounter(counterPath, true);
  if (posted == nullptr) {
    std::fprintf(stderr, "tarn-demo --remote: cannot map %s\n", counterPath.c_str());
    return 1;
  }
  Tarn::Remote::NodeOptions options;
  options.mEndpoint = own;
  Tarn::Remote::Node node(options);
  RunAccount runs[3];
  Tarn::Remote::PeerState::State peer = Tarn::Remote::PeerState::State::kConnecting;
  Clock::time_point live;
  const Tarn::Registration progress =
      Tarn::Subscribe<PluginProgress>(PluginStation(), [&](const PluginProgress& inProgress) {
        RunAccount& run = runs[inProgress.mRun == 1 ? 1 : 2];
        if (inProgress.mNumber <= run.mLastNumber) {
          ++run.mTwice;
          return;
        }
        ++run.mDelivered;
        run.mLastNumber = inProgress.mNumber;
        run.mHeardFromHost = inProgress.mHeardFromHost;
      });
  int currentRun = 1;
  const Tarn::Registration losses = Tarn::Subscribe<Tarn::Remote::RemoteLoss>(
      PluginStation(), [&](const Tarn::Remote::RemoteLoss& inLoss) { runs[currentRun].mReportedLost += inLoss.mCount; });
  const Tarn::Registration states = Tarn::Subscribe<Tarn::Remote::PeerState>(
      PluginStation(), [&](const Tarn::Remote::PeerState& inState) {
        peer = inState.mState;
        if (peer == Tarn::Remote::PeerState::State::kLive) live = Clock::now();
      });
  node.Export(HostStation());
  node.Import(PluginStation(), plugin);
  std::uint64_t commands = 0;
  auto nextCommand = Clock::now();
  const auto pump = [&](auto inDone, std::chrono::milliseconds inTimeout) {
    return RunUntil(
        [&] {
          if (Clock::now() >= nextCommand) {
            HostCommand command;
            command.mNumber = ++commands;
            Tarn::StationUtils::BroadcastMessage(HostStation(), command);
            nextCommand += std::chrono::milliseconds(20);
          }
          return inDone();
        },
        inTimeout);
  };

  std::printf("tarn-demo --remote: host %d, plug-in runs 2 x %llu messages, the first killed halfway\n",
              static_cast<int>(::getpid()), static_cast<unsigned long long>(kMessagesPerRun));
  pid_t child = StartPlugin(inSelf, 1, plugin, own, counterPath);
  bool ok = pump([&] { return runs[1].mLastNumber >= kMessagesPerRun / 2; }, std::chrono::seconds(20));
  ::kill(child, SIGKILL);
  ::waitpid(child, nullptr, 0);
  runs[1].mPosted = posted->load();
  ok = ok && pump([&] { return peer == Tarn::Remote::PeerState::State::kLost; }, std::chrono::seconds(5));

  currentRun = 2;
  posted->store(0);
  const Clock::time_point restarted = Clock::now();
  child = StartPlugin(inSelf, 2, plugin, own, counterPath);
  ok = ok && pump([&] { return peer == Tarn::Remote::PeerState::State::kLive; }, std::chrono::seconds(5));
  const auto reconnect = std::chrono::duration_cast<std::chrono::milliseconds>(live - restarted);
  ok = ok && pump([&] { return runs[2].mLastNumber == kMessagesPerRun; }, std::chrono::seconds(30));
  int status = 0;
  ::waitpid(child, &status, 0);
  runs[2].mPosted = posted->load();
  ok = ok && WIFEXITED(status) && WEXITSTATUS(status) == 0;
  ::munmap(posted, sizeof(std::uint64_t));
  ::unlink(counterPath.c_str());

  std::uint64_t silent = 0;
  std::uint64_t twice = 0;
  std::printf("%-5s %9s %10s %14s %17s %7s %6s %16s\n", "run", "posted", "delivered", "reported lost",
              "lost with process", "silent", "twice", "host heard back");
  for (int run = 1; run <= 2; ++run) {
    const RunAccount& account = runs[run];
    // Up to the last delivered, each is delivered or reported; after it,
    // only the killed process knew of them.
    const std::uint64_t accounted = account.mDelivered + account.mReportedLost;
    const std::uint64_t silentHere = account.mLastNumber > accounted ? account.mLastNumber - accounted : 0;
    const std::uint64_t withProcess = account.mPosted > account.mLastNumber ? account.mPosted - account.mLastNumber : 0;
    silent += silentHere;
    twice += account.mTwice;
    ok = ok && account.mPosted == account.mDelivered + account.mReportedLost + withProcess;
    std::printf("%-5d %9llu %10llu %14llu %17llu %7llu %6llu %16llu\n", run,
                static_cast<unsigned long long>(account.mPosted), static_cast<unsigned long long>(account.mDelivered),
                static_cast<unsigned long long>(account.mReportedLost), static_cast<unsigned long long>(withProcess),
                static_cast<unsigned long long>(silentHere), static_cast<unsigned long long>(account.mTwice),
                static_cast<unsigned long long>(account.mHeardFromHost));
  }
  std::printf("the restarted plug-in was live again %lld ms after it was started\n",
              static_cast<long long>(reconnect.count()));
  ok = ok && silent == 0 && twice == 0 && runs[2].mHeardFromHost > 0;
  std::printf("%s\n", ok ? "every message accounted for" : "FAILED: a message unaccounted for, or a run that did not finish");
  return ok ? 0 : 1;
}

}  // namespace

bool IsRemoteDemo(int inArgc, char** inArgv) {
  return inArgc >= 2 && (std::strcmp(inArgv[1], "--remote") == 0 || std::strcmp(inArgv[1], "--remote-plugin") == 0);
}

int RunRemoteDemo(int inArgc, char** inArgv) {
  Tarn::Messaging::Initialize();
  Tarn::StationRegistry::RegisterStation(PluginStation(), nullptr);
  Tarn::StationRegistry::RegisterStation(HostStation(), nullptr);
  int status = 2;
  if (std::strcmp(inArgv[1], "--remote") == 0 && inArgc == 2) {
    status = RunHost("/proc/self/exe");
  } else if (inArgc == 6) {
    status = RunPlugin(std::atoi(inArgv[2]), inArgv[3], inArgv[4], inArgv[5]);
  } else {
    std::fprintf(stderr, "tarn-demo: --remote takes no other option\n");
  }
  Tarn::Messaging::Terminate();
  return status;
}

}  // namespace tarn_demo
