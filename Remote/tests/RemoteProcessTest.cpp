// Stations across processes: this process against a child (RemotePeer.cpp)
// on the other side of a node, every wait bounded, the child killed if it
// outlives its test.
#include "BoundedWait.h"
#include "RemoteTestMessages.h"

#include <TarnMessaging.h>
#include <TarnMessaging/Remote/Node.h>

#include <kivcore/Error.h>

#include <gtest/gtest.h>

#include <poll.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

namespace {

using kivcore::utility::ImmutableString;
using remote_test::PumpUntil;
using remote_test::Tick;
using Tarn::Remote::RemoteLoss;

// The child program, started with arguments; its exit status, waited for
// with a deadline, else it is killed. Its standard output is a pipe to us.
class Peer {
public:
  // As the user inUser (0: ours), which needs root.
  explicit Peer(std::vector<std::string> inArguments, uid_t inUser = 0) {
    inArguments.insert(inArguments.begin(), TARN_REMOTE_PEER);
    std::vector<char*> argv;
    for (std::string& argument : inArguments) argv.push_back(argument.data());
    argv.push_back(nullptr);
    int output[2];
    if (::pipe(output) != 0) return;
    mPid = ::fork();
    if (mPid == 0) {
      ::dup2(output[1], STDOUT_FILENO);
      if (inUser != 0 && (::setgid(inUser) != 0 || ::setuid(inUser) != 0)) ::_exit(126);
      ::execv(argv[0], argv.data());
      ::_exit(127);
    }
    ::close(output[1]);
    mOutput = output[0];
  }
  ~Peer() {
    Kill();
    if (mOutput >= 0) ::close(mOutput);
  }
  // Whether the child wrote a byte within 10 s: its signal that it is ready.
  bool WaitForSignal() {
    pollfd readable{mOutput, POLLIN, 0};
    char byte = 0;
    return ::poll(&readable, 1, 10000) == 1 && ::read(mOutput, &byte, 1) == 1;
  }
  void Kill() {
    if (mPid > 0) {
      ::kill(mPid, SIGKILL);
      ::waitpid(mPid, nullptr, 0);
      mPid = -1;
    }
  }
  // The exit status, or -1 when the child has not exited within 10 s.
  int Wait() {
    int status = 0;
    for (int round = 0; round < 1000; ++round) {
      if (::waitpid(mPid, &status, WNOHANG) == mPid) {
        mPid = -1;
        return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
      }
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return -1;
  }

private:
  pid_t mPid = -1;
  int mOutput = -1;
};

class RemoteProcess : public ::testing::Test {
protected:
  void SetUp() override {
    Tarn::Messaging::Initialize();
    for (const char* station : {"test.remote", "test.twoway", "test.raw"}) {
      Tarn::StationRegistry::RegisterStation(ImmutableString::CreateStatic(station), nullptr);
    }
  }
  void TearDown() override { Tarn::Messaging::Terminate(); }
  static std::string Endpoint(const char* inRole) {
    return Tarn::Remote::Node::DefaultEndpoint("test-" + std::to_string(::getpid()) + "-" + inRole);
  }
};

TEST_F(RemoteProcess, ABurstThroughAFullExportQueueArrivesInOrderAndEveryLossIsReported) {
  const ImmutableString station = ImmutableString::CreateStatic("test.remote");
  const std::string exporter = Endpoint("burst");
  Tarn::Remote::Node node(Tarn::Remote::NodeOptions("test-" + std::to_string(::getpid()) + "-importer"));
  std::vector<std::uint64_t> numbers;
  std::uint64_t lost = 0;
  const Tarn::Registration ticks =
      Tarn::Subscribe<Tick>(station, [&](const Tick& inTick) { numbers.push_back(inTick.mNumber); });
  const Tarn::Registration losses = Tarn::Subscribe<RemoteLoss>(station, [&](const RemoteLoss& inLoss) {
    EXPECT_EQ(inLoss.mReason, RemoteLoss::Reason::kGap);
    lost += inLoss.mCount;
  });
  node.Import(station, exporter);
  constexpr std::uint64_t kCount = 3000;
  // An export queue of two against a burst: most of it is dropped.
  Peer peer({"burst", exporter, std::to_string(kCount), "2"});
  ASSERT_TRUE(PumpUntil([&] { return !numbers.empty() && numbers.back() == kCount + 1; }));
  EXPECT_EQ(peer.Wait(), 0);
  for (std::size_t i = 1; i < numbers.size(); ++i) ASSERT_LT(numbers[i - 1], numbers[i]) << "at " << i;
  EXPECT_GT(lost, 0u);
  EXPECT_EQ(numbers.size() + lost, kCount + 1) << "every message delivered or reported lost, none twice";
  EXPECT_EQ(node.GetStats().mLost, lost);
}

TEST_F(RemoteProcess, AnImporterWhoseMainThreadIsBehindHoldsABoundedBacklogAndReportsTheRest) {
  const ImmutableString station = ImmutableString::CreateStatic("test.remote");
  const std::string exporter = Endpoint("flood");
  Tarn::Remote::NodeOptions options("test-" + std::to_string(::getpid()) + "-behind");
  options.mQueueCapacity = 50;
  options.mHeartbeatMilliseconds = 20;  // the I/O thread's round, which reports once there is room
  Tarn::Remote::Node node(options);
  std::vector<std::uint64_t> numbers;
  std::uint64_t behind = 0;
  std::uint64_t gaps = 0;
  const Tarn::Registration ticks =
      Tarn::Subscribe<Tick>(station, [&](const Tick& inTick) { numbers.push_back(inTick.mNumber); });
  const Tarn::Registration losses = Tarn::Subscribe<RemoteLoss>(station, [&](const RemoteLoss& inLoss) {
    (inLoss.mReason == RemoteLoss::Reason::kMainThreadBehind ? behind : gaps) += inLoss.mCount;
  });
  node.Import(station, exporter);
  constexpr std::uint64_t kCount = 2000;
  Peer peer({"burst", exporter, std::to_string(kCount), "100000"});
  // The main thread does nothing until the node has heard everything.
  EXPECT_TRUE(tarn_test::WaitUntil([&] {
    const Tarn::Remote::NodeStats stats = node.GetStats();
    return stats.mImported + stats.mLost == kCount + 1;
  }));
  EXPECT_EQ(peer.Wait(), 0);
  ASSERT_TRUE(PumpUntil([&] { return numbers.size() + behind + gaps == kCount + 1; }))
      << numbers.size() << " delivered, " << behind << " reported behind, " << gaps << " in gaps";
  EXPECT_LE(numbers.size(), options.mQueueCapacity) << "no more than the bound before the main thread ran";
  EXPECT_GT(behind, 0u);
  EXPECT_EQ(behind, node.GetStats().mMainThreadBehind);
  for (std::size_t i = 1; i < numbers.size(); ++i) ASSERT_LT(numbers[i - 1], numbers[i]);
}

TEST_F(RemoteProcess, MisuseIsReportedAndTheNodeGoesOnAsIfNotCalled) {
  const ImmutableString station = ImmutableString::CreateStatic("test.remote");
  std::vector<std::string> reports;
  const auto previous = kivcore::config::SetErrorHandler(
      [&](const kivcore::config::ErrorReport& inReport) { reports.push_back(inReport.key); });
  EXPECT_THROW(Tarn::Remote::Node(Tarn::Remote::NodeOptions("a/b")), std::invalid_argument);
  Tarn::Remote::Node node(Tarn::Remote::NodeOptions("test-" + std::to_string(::getpid()) + "-misused"));
  node.Import(station, "http://nowhere");
  node.Import(ImmutableString(), Endpoint("nobody"));
  node.Import(station, "tcp://127.0.0.1:1", "not a key");
  node.Export(ImmutableString());
  kivcore::config::SetErrorHandler(previous);
  EXPECT_EQ(reports.size(), 5u);
  // An endpoint libzmq refuses at once: the first import the I/O thread gets.
  node.Import(station, "ipc:///" + std::string(200, 'x'));
  EXPECT_TRUE(tarn_test::WaitUntil([&] { return node.GetStats().mImportErrors > 0; }));
  EXPECT_EQ(node.GetStats().mImportErrors, 1u);
}

TEST_F(RemoteProcess, AStationSharedBothWaysCarriesEachMessageOnceAndNothingEchoes) {
  const ImmutableString station = ImmutableString::CreateStatic("test.twoway");
  const std::string own = Endpoint("parent");
  const std::string child = Endpoint("child");
  Tarn::Remote::NodeOptions options;
  options.mEndpoint = own;
  Tarn::Remote::Node node(options);
  std::uint32_t importers = 0;
  std::vector<Tick> heard;
  const Tarn::Registration counted = Tarn::Subscribe<Tarn::Remote::ImportersChanged>(
      station, [&](const Tarn::Remote::ImportersChanged& inChanged) { importers = inChanged.mImporters; });
  const Tarn::Registration ticks = Tarn::Subscribe<Tick>(station, [&](const Tick& inTick) { heard.push_back(inTick); });
  node.Export(station);
  node.Import(station, child);
  constexpr std::uint64_t kCount = 200;
  Peer peer({"twoway", child, own, std::to_string(kCount)});
  const auto heardFrom = [&](std::int32_t inSender) {
    std::vector<std::uint64_t> numbers;
    for (const Tick& tick : heard) {
      if (tick.mSender == inSender) numbers.push_back(tick.mNumber);
    }
    return numbers;
  };
  ASSERT_TRUE(PumpUntil([&] { return importers > 0 && !heardFrom(3).empty(); }));
  for (std::uint64_t number = 1; number <= kCount; ++number) {
    Tick tick;
    tick.mNumber = number;
    Tarn::StationUtils::BroadcastMessage(station, tick);
  }
  ASSERT_TRUE(PumpUntil([&] { return !heardFrom(2).empty(); }));
  EXPECT_EQ(peer.Wait(), 0);
  std::vector<std::uint64_t> expected;
  for (std::uint64_t number = 1; number <= kCount; ++number) expected.push_back(number);
  EXPECT_EQ(heardFrom(1), expected) << "each answer once, in order";
  EXPECT_EQ(heardFrom(0), expected) << "our own ticks heard once, locally: none came back";
  EXPECT_EQ(heardFrom(2), std::vector<std::uint64_t>{0}) << "echoes the child heard";
  EXPECT_EQ(node.GetStats().mDuplicates, 0u);
}

TEST_F(RemoteProcess, UnknownMalformedRepeatedAndMissingInputIsReportedNeverDelivered) {
  const ImmutableString station = ImmutableString::CreateStatic("test.raw");
  const std::string exporter = Endpoint("raw");
  Tarn::Remote::Node node(Tarn::Remote::NodeOptions("test-" + std::to_string(::getpid()) + "-rawimporter"));
  std::vector<std::uint64_t> numbers;
  std::vector<RemoteLoss> reports;
  const Tarn::Registration ticks =
      Tarn::Subscribe<Tick>(station, [&](const Tick& inTick) { numbers.push_back(inTick.mNumber); });
  const Tarn::Registration losses =
      Tarn::Subscribe<RemoteLoss>(station, [&](const RemoteLoss& inLoss) { reports.push_back(inLoss); });
  node.Import(station, exporter);
  Peer peer({"raw", exporter});
  ASSERT_TRUE(PumpUntil([&] { return !numbers.empty() && numbers.back() == 8; }));
  EXPECT_EQ(peer.Wait(), 0);
  EXPECT_EQ(numbers, (std::vector<std::uint64_t>{1, 7, 8}));
  using Reason = RemoteLoss::Reason;
  const std::vector<std::pair<Reason, std::uint64_t>> expected{
      {Reason::kUnknownType, 77}, {Reason::kUnknownVersion, 77}, {Reason::kMalformed, 77},
      {Reason::kMalformed, 0},    {Reason::kMalformed, 0},       {Reason::kGap, 77}};
  ASSERT_EQ(reports.size(), expected.size());
  for (std::size_t i = 0; i < expected.size(); ++i) {
    EXPECT_EQ(reports[i].mReason, expected[i].first) << i;
    EXPECT_EQ(reports[i].mOrigin, expected[i].second) << i;
  }
  EXPECT_EQ(reports[0].mWireName, "test.nobody");
  EXPECT_EQ(reports[1].mWireName, "test.tick");
  EXPECT_EQ(reports[5].mCount, 2u);
  const Tarn::Remote::NodeStats stats = node.GetStats();
  EXPECT_EQ(stats.mDuplicates, 3u);
  EXPECT_EQ(stats.mUnknown, 2u);
  EXPECT_EQ(stats.mMalformed, 3u);
}

TEST_F(RemoteProcess, AnExporterKilledAndRestartedIsLiveAgainAndHeardWithoutAReportedLoss) {
  const ImmutableString station = ImmutableString::CreateStatic("test.remote");
  const std::string exporter = Endpoint("restarted");
  Tarn::Remote::Node node(Tarn::Remote::NodeOptions("test-" + std::to_string(::getpid()) + "-watcher"));
  using State = Tarn::Remote::PeerState::State;
  std::vector<State> states;
  std::vector<std::int32_t> senders;
  std::uint64_t lost = 0;
  const Tarn::Registration peers = Tarn::Subscribe<Tarn::Remote::PeerState>(
      station, [&](const Tarn::Remote::PeerState& inState) {
        EXPECT_EQ(inState.mEndpoint, exporter);
        states.push_back(inState.mState);
      });
  const Tarn::Registration ticks =
      Tarn::Subscribe<Tick>(station, [&](const Tick& inTick) { senders.push_back(inTick.mSender); });
  const Tarn::Registration losses =
      Tarn::Subscribe<RemoteLoss>(station, [&](const RemoteLoss& inLoss) { lost += inLoss.mCount; });
  node.Import(station, exporter);
  {
    Peer first({"serve", exporter, "1"});
    ASSERT_TRUE(PumpUntil([&] { return senders.size() == 1; }));
    first.Kill();
  }
  ASSERT_TRUE(PumpUntil([&] { return !states.empty() && states.back() == State::kLost; }));
  const auto restarted = std::chrono::steady_clock::now();
  Peer second({"serve", exporter, "2"});
  ASSERT_TRUE(PumpUntil([&] { return !states.empty() && states.back() == State::kLive; }));
  std::printf("live again %lld ms after the restart began\n",
              static_cast<long long>(std::chrono::duration_cast<std::chrono::milliseconds>(
                                         std::chrono::steady_clock::now() - restarted)
                                         .count()));
  ASSERT_TRUE(PumpUntil([&] { return senders.size() == 2; }));
  EXPECT_EQ(senders, (std::vector<std::int32_t>{1, 2}));
  EXPECT_EQ(states, (std::vector<State>{State::kConnecting, State::kLive, State::kLost, State::kLive}));
  EXPECT_EQ(lost, 0u) << "a restarted exporter is a new origin: its count starts afresh";
}

TEST_F(RemoteProcess, AnExporterWhoseMainThreadIsStuckIsDeclaredSuspectInTime) {
  const ImmutableString station = ImmutableString::CreateStatic("test.remote");
  const std::string exporter = Endpoint("hung");
  Tarn::Remote::NodeOptions options("test-" + std::to_string(::getpid()) + "-suspecting");
  options.mSuspectAfterMilliseconds = 400;
  Tarn::Remote::Node node(options);
  using State = Tarn::Remote::PeerState::State;
  std::vector<State> states;
  std::size_t ticks = 0;
  const Tarn::Registration peers = Tarn::Subscribe<Tarn::Remote::PeerState>(
      station, [&](const Tarn::Remote::PeerState& inState) { states.push_back(inState.mState); });
  const Tarn::Registration tick = Tarn::Subscribe<Tick>(station, [&](const Tick&) { ++ticks; });
  node.Import(station, exporter);
  Peer peer({"hang", exporter, "1"});
  ASSERT_TRUE(PumpUntil([&] { return ticks == 1; }));
  const auto stuck = std::chrono::steady_clock::now();
  ASSERT_TRUE(PumpUntil([&] { return states.back() == State::kSuspect; }));
  EXPECT_LT(std::chrono::steady_clock::now() - stuck, std::chrono::milliseconds(400 + 100 + 400))
      << "silence, the check's period, and slack for a loaded machine";
  EXPECT_EQ(states.front(), State::kConnecting);
  peer.Kill();
  ASSERT_TRUE(PumpUntil([&] { return states.back() == State::kLost; }));
}

TEST_F(RemoteProcess, AnImporterThatConnectsGetsTheLatestStateOnceAndOthersNoRepeat) {
  const ImmutableString station = ImmutableString::CreateStatic("test.remote");
  const std::string exporter = Endpoint("state");
  const std::string pid = std::to_string(::getpid());
  std::vector<std::int32_t> statuses;
  std::vector<std::uint64_t> ticks;
  std::uint64_t lost = 0;
  const Tarn::Registration status = Tarn::Subscribe<remote_test::Status>(
      station, [&](const remote_test::Status& inStatus) { statuses.push_back(inStatus.mValue); });
  const Tarn::Registration tick = Tarn::Subscribe<Tick>(station, [&](const Tick& inTick) { ticks.push_back(inTick.mNumber); });
  const Tarn::Registration losses =
      Tarn::Subscribe<RemoteLoss>(station, [&](const RemoteLoss& inLoss) { lost += inLoss.mCount; });
  Peer peer({"state", exporter});
  ASSERT_TRUE(peer.WaitForSignal()) << "the statuses have left the exporter";
  Tarn::Remote::Node first(Tarn::Remote::NodeOptions("test-" + pid + "-first"));
  first.Import(station, exporter);
  ASSERT_TRUE(PumpUntil([&] { return ticks.size() == 1; }));
  EXPECT_EQ(statuses, std::vector<std::int32_t>{3}) << "the latest value, before the next message";
  // A second importer (another node, which delivers on the same station
  // here): it takes the snapshot in, the first node drops it.
  Tarn::Remote::Node second(Tarn::Remote::NodeOptions("test-" + pid + "-second"));
  second.Import(station, exporter);
  ASSERT_TRUE(PumpUntil([&] { return ticks.size() == 3; }));
  EXPECT_EQ(statuses, (std::vector<std::int32_t>{3, 3}));
  EXPECT_EQ(ticks, (std::vector<std::uint64_t>{1, 2, 2}));
  EXPECT_EQ(lost, 0u) << "what was broadcast before an importer came is not its loss";
  EXPECT_EQ(first.GetStats().mImported, 3u);
  EXPECT_EQ(second.GetStats().mImported, 2u);
}

TEST_F(RemoteProcess, AnImporterOfAnotherUserIsRefusedByTheNodeOrByTheStation) {
  if (::geteuid() != 0) GTEST_SKIP() << "starting a child as another user needs root";
  constexpr uid_t kNobody = 65534;
  // A directory open to all, so that only the nodes' own checks stand
  // between the other user and the station.
  const std::string directory = "/tmp/tarn-remote-open-" + std::to_string(::getpid());
  ASSERT_EQ(::mkdir(directory.c_str(), 0777), 0);
  ::chmod(directory.c_str(), 0777);
  const ImmutableString station = ImmutableString::CreateStatic("test.remote");
  std::uint32_t importers = 0;  // the most at once
  {
    // Node A lets in this user only; node B lets nobody in too, but not to
    // test.remote.
    Tarn::Remote::NodeOptions onlyUs;
    onlyUs.mEndpoint = "ipc://" + directory + "/a";
    Tarn::Remote::NodeOptions perStation;
    perStation.mEndpoint = "ipc://" + directory + "/b";
    perStation.mAllowedUsers = {::geteuid(), kNobody};
    perStation.mStationUsers["test.remote"] = {::geteuid()};
    Tarn::Remote::Node a(onlyUs);
    Tarn::Remote::Node b(perStation);
    for (const char* socket : {"/a", "/b"}) ::chmod((directory + socket).c_str(), 0777);
    const Tarn::Registration counted = Tarn::Subscribe<Tarn::Remote::ImportersChanged>(
        station, [&](const Tarn::Remote::ImportersChanged& inChanged) {
          importers = std::max(importers, inChanged.mImporters);
        });
    a.Export(station);
    b.Export(station);
    Peer refusedByNode({"import", "ipc://" + directory + "/other-a", onlyUs.mEndpoint}, kNobody);
    EXPECT_EQ(refusedByNode.Wait(), 3) << "not live";
    EXPECT_GT(a.GetStats().mRefusedPeers, 0u);
    Peer refusedByStation({"import", "ipc://" + directory + "/other-b", perStation.mEndpoint}, kNobody);
    EXPECT_EQ(refusedByStation.Wait(), 2) << "live, and nothing heard";
    EXPECT_GT(b.GetStats().mRefusedPeers, 0u);
    Peer same({"import", "ipc://" + directory + "/same", perStation.mEndpoint});
    ASSERT_TRUE(PumpUntil([&] { return importers > 0; }));
    Tarn::StationUtils::BroadcastMessage(station, Tick());
    EXPECT_EQ(same.Wait(), 0) << "heard";
  }
  EXPECT_EQ(importers, 1u) << "at most one importer at a time: only the one of our user subscribed";
  std::system(("rm -rf " + directory).c_str());
}

TEST_F(RemoteProcess, OverTcpWithCurveOnlyAPeerWithAnAllowedKeyHearsTheStation) {
  const ImmutableString station = ImmutableString::CreateStatic("test.remote");
  const auto [serverPublic, serverSecret] = Tarn::Remote::Node::MakeCurveKeyPair();
  const auto [allowedPublic, allowedSecret] = Tarn::Remote::Node::MakeCurveKeyPair();
  const auto [strangerPublic, strangerSecret] = Tarn::Remote::Node::MakeCurveKeyPair();
  Tarn::Remote::NodeOptions options;
  options.mEndpoint = "tcp://127.0.0.1:*";
  options.mCurvePublicKey = serverPublic;
  options.mCurveSecretKey = serverSecret;
  options.mAllowedCurveKeys = {allowedPublic};
  Tarn::Remote::Node node(options);
  ASSERT_EQ(node.GetEndpoint().rfind("tcp://127.0.0.1:", 0), 0u);
  EXPECT_NE(node.GetEndpoint(), options.mEndpoint) << "the port taken";
  std::uint32_t importers = 0;
  const Tarn::Registration counted = Tarn::Subscribe<Tarn::Remote::ImportersChanged>(
      station, [&](const Tarn::Remote::ImportersChanged& inChanged) { importers = inChanged.mImporters; });
  node.Export(station);
  const auto importer = [&](const char* inRole, const std::string& inPublic, const std::string& inSecret) {
    return std::vector<std::string>{"import", Endpoint(inRole), node.GetEndpoint(), inPublic, inSecret, serverPublic};
  };
  Peer stranger(importer("stranger", strangerPublic, strangerSecret));
  EXPECT_EQ(stranger.Wait(), 3) << "not live";
  EXPECT_GT(node.GetStats().mRefusedPeers, 0u);
  Peer allowed(importer("allowed", allowedPublic, allowedSecret));
  ASSERT_TRUE(PumpUntil([&] { return importers > 0; }));
  Tarn::StationUtils::BroadcastMessage(station, Tick());
  EXPECT_EQ(allowed.Wait(), 0) << "heard";
}

}  // namespace

