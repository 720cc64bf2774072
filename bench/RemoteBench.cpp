// tarn-remote-bench: a station across two processes against the transports
// under it. A sender process (forked, pinned to the second CPU) sends
// 16-byte stamps to a receiver (this process, pinned to the first); each
// row measures the same two things:
//   latency    5000 stamps paced at 10k/s, from the send call to the
//              receiver's handler: p50 and p99 (CLOCK_MONOTONIC, which both
//              processes share);
//   burst      200k stamps as fast as the sender goes: messages per second
//              received, and how many arrived.
// Rows: a Unix socket pair (the floor), raw libzmq PUB/SUB over ipc (the
// engine), and the remote station (Tarn::Remote: a worker's
// PostMessageToUIThread on the exporter, to the start of the handler on
// the importer's main thread). Prints a table and the ratios against the
// targets. Not a test: the figures depend on the machine and its load.
#include <TarnMessaging.h>
#include <TarnMessaging/Remote/Node.h>
#include <TarnMessaging/Remote/WireMessage.h>

#include <kivcore/MainThread.h>

#include <zmq.hpp>

#include <sched.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <functional>
#include <string>
#include <thread>
#include <vector>

namespace bench_remote {

struct Stamp : Tarn::MessageImpl<Stamp> {
  std::uint64_t mSent = 0;    // CLOCK_MONOTONIC nanoseconds at the send call
  std::uint64_t mNumber = 0;  // 1, 2, ... within a phase
};
TARN_WIRE_MESSAGE(Stamp, "bench.stamp", 1, mSent, mNumber)

}  // namespace bench_remote

namespace {

using bench_remote::Stamp;

constexpr std::uint64_t kLatencyCount = 5000;
constexpr std::uint64_t kLatencyPeriodNanos = 100000;  // 10k/s
constexpr std::uint64_t kBurstCount = 200000;

std::uint64_t NowNanos() {
  timespec now{};
  clock_gettime(CLOCK_MONOTONIC, &now);
  return static_cast<std::uint64_t>(now.tv_sec) * 1000000000u + static_cast<std::uint64_t>(now.tv_nsec);
}

void Pin(int inCpu) {
  if (std::thread::hardware_concurrency() < 2) return;
  cpu_set_t set;
  CPU_ZERO(&set);
  CPU_SET(inCpu, &set);
  sched_setaffinity(0, sizeof(set), &set);
}

// Calls inSend(number, stamp) for each stamp of both phases: the latency
// phase paced, the burst as fast as it goes, a pause between them.
void SendPhases(const std::function<void(std::uint64_t, std::uint64_t)>& inSend) {
  std::uint64_t next = NowNanos();
  for (std::uint64_t number = 1; number <= kLatencyCount; ++number) {
    // Yielding, so that the sender's other threads (the remote station's
    // main and I/O threads) run on its CPU meanwhile.
    while (NowNanos() < next) std::this_thread::yield();
    inSend(number, NowNanos());
    next += kLatencyPeriodNanos;
  }
  std::this_thread::sleep_for(std::chrono::milliseconds(200));
  for (std::uint64_t number = 1; number <= kBurstCount; ++number) inSend(number, NowNanos());
}

// What the receiver makes of the stamps it hears.
struct Receiver {
  std::vector<std::uint64_t> mLatencies;
  bool mBurst = false;
  std::uint64_t mBurstReceived = 0;
  std::uint64_t mBurstFirst = 0;
  std::uint64_t mBurstLast = 0;
  std::uint64_t mLastHeard = 0;  // when anything last came
  std::uint64_t mLastNumber = 0;

  void Hear(std::uint64_t inNumber, std::uint64_t inSent) {
    const std::uint64_t now = NowNanos();
    mLastHeard = now;
    // The burst numbers start again from 1.
    if (!mBurst && inNumber < mLastNumber) mBurst = true;
    mLastNumber = inNumber;
    if (!mBurst) {
      mLatencies.push_back(now - inSent);
      return;
    }
    if (mBurstReceived++ == 0) mBurstFirst = now;
    mBurstLast = now;
  }
  bool Done() const {
    return mBurstReceived == kBurstCount ||
           (mBurstReceived > 0 && NowNanos() - mLastHeard > 500000000u);  // half a second of silence
  }
};

struct Row {
  const char* mName;
  Receiver mReceiver;
};

double Percentile(std::vector<std::uint64_t> inValues, double inRank) {
  if (inValues.empty()) return 0;
  std::sort(inValues.begin(), inValues.end());
  return static_cast<double>(inValues[static_cast<std::size_t>(inRank * (inValues.size() - 1))]) / 1000.0;
}

// Forks the sender, which waits for a byte on a pipe before sending.
pid_t Fork(const std::function<void()>& inSender) {
  const pid_t pid = ::fork();
  if (pid == 0) {
    Pin(1);
    inSender();
    ::_exit(0);
  }
  return pid;
}

void UnixSocketRow(Receiver& ioReceiver) {
  int pair[2];
  if (::socketpair(AF_UNIX, SOCK_SEQPACKET, 0, pair) != 0) return;
  const pid_t pid = Fork([&] {
    ::close(pair[0]);
    SendPhases([&](std::uint64_t inNumber, std::uint64_t inSent) {
      const std::uint64_t record[2] = {inNumber, inSent};
      (void)::send(pair[1], record, sizeof(record), 0);
    });
  });
  ::close(pair[1]);
  std::uint64_t record[2];
  while (!ioReceiver.Done() && ::recv(pair[0], record, sizeof(record), 0) == sizeof(record)) {
    ioReceiver.Hear(record[0], record[1]);
  }
  ::close(pair[0]);
  ::waitpid(pid, nullptr, 0);
}

void LibzmqRow(Receiver& ioReceiver, const std::string& inEndpoint) {
  const pid_t pid = Fork([&] {
    zmq::context_t context(1);
    zmq::socket_t publisher(context, zmq::socket_type::xpub);
    publisher.set(zmq::sockopt::sndhwm, 10000);
    publisher.bind(inEndpoint);
    zmq::message_t subscription;
    (void)publisher.recv(subscription);  // the receiver is there
    SendPhases([&](std::uint64_t inNumber, std::uint64_t inSent) {
      const std::uint64_t record[2] = {inNumber, inSent};
      publisher.send(zmq::buffer(record, sizeof(record)), zmq::send_flags::none);
    });
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
  });
  zmq::context_t context(1);
  zmq::socket_t subscriber(context, zmq::socket_type::sub);
  subscriber.set(zmq::sockopt::rcvhwm, 10000);
  subscriber.set(zmq::sockopt::rcvtimeo, 600);
  subscriber.set(zmq::sockopt::subscribe, "");
  subscriber.connect(inEndpoint);
  zmq::message_t message;
  while (!ioReceiver.Done()) {
    if (!subscriber.recv(message)) {
      if (ioReceiver.mBurstReceived > 0) break;
      continue;
    }
    std::uint64_t record[2];
    if (message.size() == sizeof(record)) {
      std::memcpy(record, message.data(), sizeof(record));
      ioReceiver.Hear(record[0], record[1]);
    }
  }
  ::waitpid(pid, nullptr, 0);
}

template <class Predicate>
void RunUntil(Predicate inDone, std::chrono::seconds inLimit) {
  const auto mainThread = kivcore::threads::GetRegisteredMainThread();
  const auto deadline = std::chrono::steady_clock::now() + inLimit;
  while (!inDone() && std::chrono::steady_clock::now() < deadline) {
    if (mainThread->WaitForPendingCalls(1)) mainThread->RunPendingCalls();
  }
}

void RemoteStationRow(Receiver& ioReceiver, const std::string& inEndpoint) {
  const auto station = kivcore::utility::ImmutableString::CreateStatic("bench.remote");
  const pid_t pid = Fork([&] {
    Tarn::Messaging::Initialize();
    Tarn::StationRegistry::RegisterStation(station, nullptr);
    {
      Tarn::Remote::NodeOptions options;
      options.mEndpoint = inEndpoint;
      Tarn::Remote::Node node(options);
      std::uint32_t importers = 0;
      const Tarn::Registration counted = Tarn::Subscribe<Tarn::Remote::ImportersChanged>(
          station, [&](const Tarn::Remote::ImportersChanged& inChanged) { importers = inChanged.mImporters; });
      node.Export(station);
      RunUntil([&] { return importers > 0; }, std::chrono::seconds(10));
      std::atomic<bool> done{false};
      std::thread worker([&] {
        SendPhases([&](std::uint64_t inNumber, std::uint64_t inSent) {
          Stamp stamp;
          stamp.mNumber = inNumber;
          stamp.mSent = inSent;
          Tarn::StationUtils::PostMessageToUIThread(station, stamp, true);
        });
        done = true;
      });
      RunUntil([&] { return done.load(); }, std::chrono::seconds(60));
      worker.join();
      RunUntil([] { return false; }, std::chrono::seconds(1));  // the last posts, and the linger
    }
    Tarn::Messaging::Terminate();
  });
  Tarn::Messaging::Initialize();
  Tarn::StationRegistry::RegisterStation(station, nullptr);
  {
    Tarn::Remote::Node node(Tarn::Remote::NodeOptions("tarn-remote-bench-" + std::to_string(::getpid())));
    const Tarn::Registration stamps = Tarn::Subscribe<Stamp>(
        station, [&](const Stamp& inStamp) { ioReceiver.Hear(inStamp.mNumber, inStamp.mSent); });
    node.Import(station, inEndpoint);
    RunUntil([&] { return ioReceiver.Done(); }, std::chrono::seconds(60));
  }
  Tarn::Messaging::Terminate();
  ::waitpid(pid, nullptr, 0);
}

// Fan-out: importer processes forked first (each reports on a pipe what it
// received: count, first and last time), then this process exports and
// broadcasts kFanOutCount stamps from its main thread, with an export queue
// that holds them all, so that what an importer misses is its own socket's
// high-water mark. A slow importer sleeps inSlowMicros in each handler.
constexpr std::uint64_t kFanOutCount = 100000;

struct Heard {
  std::uint64_t mReceived = 0;
  std::uint64_t mFirst = 0;
  std::uint64_t mLast = 0;
  double Rate() const { return mLast > mFirst ? mReceived / (static_cast<double>(mLast - mFirst) / 1e9) : 0; }
};

long ResidentKilobytes() {
  long pages = 0;
  long resident = 0;
  if (std::FILE* statm = std::fopen("/proc/self/statm", "r")) {
    if (std::fscanf(statm, "%ld %ld", &pages, &resident) != 2) resident = 0;
    std::fclose(statm);
  }
  return resident * (::sysconf(_SC_PAGESIZE) / 1024);
}

std::vector<Heard> FanOut(const std::string& inEndpoint, const std::vector<int>& inSlowMicros, long& outGrowth) {
  const auto station = kivcore::utility::ImmutableString::CreateStatic("bench.fanout");
  std::vector<std::pair<pid_t, int>> children;
  for (std::size_t i = 0; i < inSlowMicros.size(); ++i) {
    int pipe[2];
    if (::pipe(pipe) != 0) break;
    const int slow = inSlowMicros[i];
    const pid_t pid = ::fork();
    if (pid == 0) {
      ::close(pipe[0]);
      Pin(1);  // the exporter keeps the first CPU
      Tarn::Messaging::Initialize();
      Tarn::StationRegistry::RegisterStation(station, nullptr);
      Heard heard;
      {
        Tarn::Remote::Node node(Tarn::Remote::NodeOptions("tarn-remote-bench-importer-" + std::to_string(::getpid())));
        const Tarn::Registration stamps = Tarn::Subscribe<Stamp>(station, [&](const Stamp&) {
          const std::uint64_t now = NowNanos();
          if (heard.mReceived++ == 0) heard.mFirst = now;
          heard.mLast = now;
          // Sleeping, not spinning: both importers share the second CPU, and a
          // spinning one would measure the CPU taken from the other.
          if (slow > 0) std::this_thread::sleep_for(std::chrono::microseconds(slow));
        });
        node.Import(station, inEndpoint);
        RunUntil(
            [&] {
              return heard.mReceived == kFanOutCount ||
                     (heard.mReceived > 0 && NowNanos() - heard.mLast > 500000000u);
            },
            std::chrono::seconds(60));
      }
      Tarn::Messaging::Terminate();
      (void)::write(pipe[1], &heard, sizeof(heard));
      ::_exit(0);
    }
    ::close(pipe[1]);
    children.emplace_back(pid, pipe[0]);
  }
  Tarn::Messaging::Initialize();
  Tarn::StationRegistry::RegisterStation(station, nullptr);
  {
    Tarn::Remote::NodeOptions options;
    options.mEndpoint = inEndpoint;
    options.mQueueCapacity = kFanOutCount;
    Tarn::Remote::Node node(options);
    std::uint32_t importers = 0;
    const Tarn::Registration counted = Tarn::Subscribe<Tarn::Remote::ImportersChanged>(
        station, [&](const Tarn::Remote::ImportersChanged& inChanged) { importers = inChanged.mImporters; });
    node.Export(station);
    RunUntil([&] { return importers == children.size(); }, std::chrono::seconds(10));
    const long before = ResidentKilobytes();
    long most = before;
    for (std::uint64_t number = 1; number <= kFanOutCount; ++number) {
      Stamp stamp;
      stamp.mNumber = number;
      stamp.mSent = NowNanos();
      Tarn::StationUtils::BroadcastMessage(station, stamp);
      if (number % 4096 == 0) most = std::max(most, ResidentKilobytes());
    }
    RunUntil([&] { return node.GetStats().mExported + node.GetStats().mExportDropped == kFanOutCount; },
             std::chrono::seconds(30));
    outGrowth = std::max(most, ResidentKilobytes()) - before;
    std::vector<Heard> heard(children.size());
    for (std::size_t i = 0; i < children.size(); ++i) {
      if (::read(children[i].second, &heard[i], sizeof(Heard)) != sizeof(Heard)) heard[i] = Heard();
      ::close(children[i].second);
      ::waitpid(children[i].first, nullptr, 0);
    }
    Tarn::Messaging::Terminate();
    return heard;
  }
}

void FanOutRows(const std::string& inPid) {
  int round = 0;
  const auto endpoint = [&] {
    return Tarn::Remote::Node::DefaultEndpoint("tarn-remote-bench-fan-" + inPid + "-" + std::to_string(++round));
  };
  long growth = 0;
  std::printf("\nFan-out: %llu stamps broadcast on the exporter's main thread as fast as it goes\n\n"
              "| importers | per importer: delivered, msg/s | exporter memory growth |\n|---|---|---:|\n",
              static_cast<unsigned long long>(kFanOutCount));
  const auto row = [&](const char* inName, const std::vector<Heard>& inHeard) {
    std::printf("| %s |", inName);
    for (const Heard& heard : inHeard) {
      std::printf(" %llu, %.0f;", static_cast<unsigned long long>(heard.mReceived), heard.Rate());
    }
    std::printf(" | %ld kB |\n", growth);
  };
  const std::vector<Heard> four = FanOut(endpoint(), {0, 0, 0, 0}, growth);
  row("4 fast", four);
  const std::vector<Heard> solo = FanOut(endpoint(), {0}, growth);
  row("1 fast", solo);
  const std::vector<Heard> mixed = FanOut(endpoint(), {0, 50}, growth);
  row("1 fast, 1 slow (sleeps 50 µs a message)", mixed);
  const double kept = solo[0].Rate() > 0 ? 100.0 * mixed[0].Rate() / solo[0].Rate() : 0;
  std::printf("\nthe fast importer beside the slow one kept %.0f%% of its solo rate (target: at least 90%%)\n", kept);
}

}  // namespace

int main() {
  Pin(0);
  const std::string pid = std::to_string(::getpid());
  std::vector<Row> rows{{"Unix socket pair", {}}, {"libzmq PUB/SUB (ipc)", {}}, {"remote station", {}}};
  std::printf("tarn-remote-bench: %u CPUs; latency: %llu stamps at 10k/s; burst: %llu stamps\n",
              std::thread::hardware_concurrency(), static_cast<unsigned long long>(kLatencyCount),
              static_cast<unsigned long long>(kBurstCount));
  UnixSocketRow(rows[0].mReceiver);
  LibzmqRow(rows[1].mReceiver, Tarn::Remote::Node::DefaultEndpoint("tarn-remote-bench-zmq-" + pid));
  RemoteStationRow(rows[2].mReceiver, Tarn::Remote::Node::DefaultEndpoint("tarn-remote-bench-node-" + pid));

  std::printf("\n| transport | p50 µs | p99 µs | burst msg/s | burst delivered |\n|---|---:|---:|---:|---:|\n");
  std::vector<double> p50(rows.size()), p99(rows.size()), rate(rows.size());
  for (std::size_t i = 0; i < rows.size(); ++i) {
    const Receiver& receiver = rows[i].mReceiver;
    p50[i] = Percentile(receiver.mLatencies, 0.50);
    p99[i] = Percentile(receiver.mLatencies, 0.99);
    const double seconds = static_cast<double>(receiver.mBurstLast - receiver.mBurstFirst) / 1e9;
    rate[i] = seconds > 0 ? static_cast<double>(receiver.mBurstReceived) / seconds : 0;
    std::printf("| %s | %.1f | %.1f | %.0f | %llu of %llu |\n", rows[i].mName, p50[i], p99[i], rate[i],
                static_cast<unsigned long long>(receiver.mBurstReceived),
                static_cast<unsigned long long>(kBurstCount));
  }
  std::printf("\nremote station against raw libzmq: p50 +%.1f µs (target within 15), p99 +%.1f µs (within 50), "
              "burst %.0f%% of its rate (at least 40%%) and %.2fM msg/s (at least 1M)\n",
              p50[2] - p50[1], p99[2] - p99[1], rate[1] > 0 ? 100.0 * rate[2] / rate[1] : 0.0, rate[2] / 1e6);
  FanOutRows(pid);
  return 0;
}
