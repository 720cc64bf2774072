// Tarn::Remote::Node: exports through a bounded queue to one I/O thread that
// owns every socket; imports decoded there and broadcast on the main thread.
#include <TarnMessaging/Remote/Node.h>

#include "RemoteContract.h"

#include <TarnMessaging/Listener.h>
#include <TarnMessaging/StationUtils.h>

#include <kivcore/MainThread.h>

#include <zmq.hpp>

#include <sys/eventfd.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstring>
#include <deque>
#include <future>
#include <map>
#include <mutex>
#include <random>
#include <set>
#include <stdexcept>
#include <thread>
#include <utility>
#include <vector>

namespace Tarn::Remote {

using kivcore::utility::ImmutableString;

namespace {

// A station's topic on the wire: its ID and a terminating NUL, so that the
// publisher's prefix filter cannot match "jobs" to "jobs.done".
std::string TopicOf(const ImmutableString& inStationID) {
  std::string topic(inStationID.c_str(), inStationID.size());
  topic.push_back('\0');
  return topic;
}

// Sequence counts kept per (origin, station) before the oldest are
// forgotten: a bound on what restarting peers cost an importer. A forgotten
// origin starts its count again with its next message.
constexpr std::size_t kMaxTrackedOrigins = 4096;

// The imported message being broadcast on the main thread, if any, by any
// node of the process: export listeners leave it alone, so that it does not
// go back out (two-way without echo), not even through another node of the
// same process. Main thread only.
const Message* sDelivering = nullptr;

// How often an importer tries again to reach an exporter it lost or has not
// reached yet.
constexpr int kReconnectMilliseconds = 50;

// The topic of heartbeats, which every importer subscribes to: no station
// ID starts with a control character.
const std::string kHeartbeatTopic("\x01tarn.heartbeat", 16);

using Clock = std::chrono::steady_clock;

std::uint64_t NewOrigin() {
  std::random_device device;
  std::uint64_t origin = 0;
  while (origin == 0) {
    origin = (static_cast<std::uint64_t>(device()) << 32) ^ device() ^
             static_cast<std::uint64_t>(::getpid()) ^
             static_cast<std::uint64_t>(std::chrono::steady_clock::now().time_since_epoch().count());
  }
  return origin;
}

}  // namespace

class Node::Impl {
public:
  explicit Impl(NodeOptions inOptions);
  ~Impl();

  void Export(const ImmutableString& inStationID);
  void Import(const ImmutableString& inStationID, const std::string& inEndpoint, const std::string& inServerKey);
  NodeStats GetStats() const noexcept;

  const std::string& Endpoint() const noexcept { return mEndpoint; }
  std::uint64_t Origin() const noexcept { return mOrigin; }

private:
  // Attached to an exported station by plain pointer; hears its broadcasts
  // on the main thread.
  class ExportListener final : public Listener {
  public:
    ExportListener(Impl& ioImpl, const ImmutableString& inStationID)
        : mImpl(ioImpl), mStationID(inStationID), mTopic(std::make_shared<const std::string>(TopicOf(inStationID))) {}
    // Detached while whole: a broadcast on the main thread may be calling it.
    ~ExportListener() override { DetachFromBroadcasters(); }
    void ListenToMessage(const Message& inMessage) override { mImpl.Enqueue(*this, inMessage); }

    Impl& mImpl;
    const ImmutableString mStationID;
    const std::shared_ptr<const std::string> mTopic;
    std::uint64_t mSequence = 0;  // the last sequence number given; main thread only
  };

  struct Outgoing {
    std::shared_ptr<const std::string> mTopic;
    std::string mBytes;
    std::uint64_t mSequence = 0;
    const WireType* mType = nullptr;
    std::shared_ptr<const Message> mState;  // a copy, for a state-like type only
  };

  // What the I/O thread sent last on one exported station: the sequence
  // number, and the latest value of each state-like type by wire name.
  struct Sent {
    std::uint64_t mSequence = 0;
    std::map<std::string, std::pair<const WireType*, std::shared_ptr<const Message>>> mStates;
  };

  // What an importer knows of one origin on one station.
  struct Track {
    std::uint64_t mLast = 0;      // the last sequence number heard; 0: none yet
    std::uint64_t mSnapshot = 0;  // the snapshot being taken in, until the next live message
  };

  struct Command {
    enum class Kind { kExport, kImport } mKind;
    ImmutableString mStationID;
    std::string mEndpoint;
    std::string mServerKey;  // CURVE, when not empty
  };

  // I/O thread only.
  // One subscribing socket per endpoint imported from, with the stations
  // it carries and the monitor that tells when its peer comes and goes.
  struct ImportSocket {
    std::string mEndpoint;
    zmq::socket_t mSocket;
    zmq::socket_t mMonitor;  // declared after mSocket, so closed before it
    std::map<std::string, ImmutableString> mStations;  // by topic
    PeerState::State mState = PeerState::State::kConnecting;
    Clock::time_point mLastHeard;  // a message or a heartbeat, or the connection
  };

  void Enqueue(ExportListener& ioListener, const Message& inMessage);
  void Wake() noexcept;
  void Run(std::promise<void>& outBound) noexcept;
  void RunLoop(zmq::context_t& ioContext, zmq::socket_t& ioPublisher, zmq::socket_t& ioAuthenticator);
  void Send(zmq::socket_t& ioPublisher, std::deque<Outgoing>& ioOutgoing);
  void Obey(zmq::context_t& ioContext, std::vector<Command>& ioCommands);
  void HearSubscriptions(zmq::socket_t& ioPublisher);
  void Authenticate(zmq::socket_t& ioHandler);
  bool IsAllowed(const std::string& inAddress, std::string& outUser) const;
  bool StationAllows(const std::string& inTopic, const std::string& inUser) const;
  void SendSnapshot(zmq::socket_t& ioPublisher, const std::string& inTopic);
  bool Admit(const ImmutableString& inStationID, const Envelope& inEnvelope);
  void AnnounceImporters(const ImmutableString& inStationID, std::uint32_t inImporters);
  void HearImports(ImportSocket& ioImport);
  void HearMonitor(ImportSocket& ioImport);
  void Beat(zmq::socket_t& ioPublisher, Clock::time_point inNow);
  void Suspect(Clock::time_point inNow);
  void ChangeState(ImportSocket& ioImport, PeerState::State inState);
  void AnnouncePeer(const ImportSocket& inImport, const ImmutableString& inStationID);
  void Receive(const ImmutableString& inStationID, const zmq::message_t& inBody);
  void Report(const ImmutableString& inStationID, RemoteLoss::Reason inReason, std::uint64_t inOrigin,
              std::uint64_t inCount, const std::string& inWireName);
  // kBounded: imported messages and loss reports, which a main thread that
  // falls behind may not hold without bound; kAlways: state changes, rare.
  enum class Bound { kBounded, kAlways };
  void Deliver(const ImmutableString& inStationID, std::shared_ptr<const Message> inMessage,
               Bound inBound = Bound::kBounded);

  // Reports, before anything else of theirs, the messages dropped because
  // the main thread was behind, once it has room again.
  void ReportDropped();

  const NodeOptions mOptions;
  const std::shared_ptr<const WireCodec> mCodec;
  const std::uint64_t mOrigin;
  std::string mEndpoint;  // fixed once the constructor returns
  int mWakeDescriptor = -1;  // an eventfd: written by any thread, read by the I/O thread
  std::vector<uid_t> mAllowedUsers;  // fixed by the constructor

  struct Counters {
    std::atomic<std::uint64_t> mExported{0}, mExportDropped{0}, mImported{0}, mLost{0}, mUnknown{0},
        mMalformed{0}, mDuplicates{0}, mImportErrors{0}, mRefusedPeers{0}, mBehind{0};
  } mCounters;

  mutable std::mutex mQueueMutex;
  std::deque<Outgoing> mQueue;      // guarded by mQueueMutex; at most mOptions.mQueueCapacity
  std::vector<Command> mCommands;   // guarded by mQueueMutex
  bool mStopping = false;           // guarded by mQueueMutex

  std::mutex mExportsMutex;
  std::map<ImmutableString, std::unique_ptr<ExportListener>> mExports;  // guarded by mExportsMutex

  // I/O thread only.
  std::set<std::string> mExportedTopics;
  std::map<std::string, std::uint32_t> mImporters;  // subscriptions per topic
  std::map<std::string, ImportSocket> mImports;     // by endpoint
  std::uint64_t mMonitors = 0;                      // monitors made, for their addresses
  std::map<std::pair<std::uint64_t, std::string>, Track> mTracks;  // by (origin, topic)
  std::map<std::string, Sent> mSent;                               // by topic
  std::uint64_t mSnapshots = 0;                                    // snapshots sent
  Clock::time_point mNextBeat;                                     // when the next heartbeat is due
  // Set by the main thread when it has run the call the last heartbeat
  // posted: a heartbeat goes out only then, so a main thread that is stuck
  // makes its importers suspect this node while its sockets are still fine.
  const std::shared_ptr<std::atomic<bool>> mMainThreadAnswered = std::make_shared<std::atomic<bool>>(true);
  // Imported messages and reports handed to the main thread and not yet
  // run: incremented here, decremented by the calls themselves.
  const std::shared_ptr<std::atomic<std::size_t>> mBacklog = std::make_shared<std::atomic<std::size_t>>(0);
  std::map<ImmutableString, std::uint64_t> mDropped;  // since the last report, by station; I/O thread only

  std::thread mThread;
};

Node::Impl::Impl(NodeOptions inOptions)
    : mOptions(std::move(inOptions)),
      mCodec(mOptions.mCodec != nullptr ? mOptions.mCodec : std::shared_ptr<const WireCodec>(MakeMsgPackCodec())),
      mOrigin(NewOrigin()) {
  const std::string name = mOptions.mName.empty() ? "tarn-" + std::to_string(::getpid()) : mOptions.mName;
  // DefaultEndpoint checks the name: without it, the name is not used.
  mEndpoint = !mOptions.mEndpoint.empty() ? mOptions.mEndpoint : Node::DefaultEndpoint(name);
  mAllowedUsers = mOptions.mAllowedUsers;
  if (mAllowedUsers.empty()) mAllowedUsers.push_back(::geteuid());
  mWakeDescriptor = ::eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC);
  if (mWakeDescriptor < 0) throw std::runtime_error(std::string("Tarn::Remote: eventfd: ") + std::strerror(errno));
  std::promise<void> bound;
  std::future<void> boundResult = bound.get_future();
  mThread = std::thread([this, &bound] { Run(bound); });
  try {
    boundResult.get();
  } catch (...) {
    mThread.join();  // the thread ends on its own when binding failed
    ::close(mWakeDescriptor);
    throw;
  }
}

Node::Impl::~Impl() {
  {
    // No broadcast reaches the queue once the listeners are gone.
    std::lock_guard<std::mutex> lock(mExportsMutex);
    mExports.clear();
  }
  {
    std::lock_guard<std::mutex> lock(mQueueMutex);
    mStopping = true;
  }
  Wake();
  mThread.join();
  ::close(mWakeDescriptor);
}

void Node::Impl::Export(const ImmutableString& inStationID) {
  TARN_REMOTE_CONTRACT_CHECK(!inStationID.empty(), "Tarn::Remote::Node::Export");
  if (inStationID.empty()) return;
  ExportListener* listener = nullptr;
  {
    std::lock_guard<std::mutex> lock(mExportsMutex);
    std::unique_ptr<ExportListener>& slot = mExports[inStationID];
    if (slot != nullptr) return;
    slot = std::make_unique<ExportListener>(*this, inStationID);
    listener = slot.get();
  }
  {
    std::lock_guard<std::mutex> lock(mQueueMutex);
    mCommands.push_back(Command{Command::Kind::kExport, inStationID, std::string(), std::string()});
  }
  Wake();
  // Attached outside our locks: AddListener may report an unregistered
  // station to the host's handlers.
  StationUtils::AddListener(inStationID, listener);
}

void Node::Impl::Import(const ImmutableString& inStationID, const std::string& inEndpoint,
                        const std::string& inServerKey) {
  const bool known = inEndpoint.rfind("ipc://", 0) == 0 || inEndpoint.rfind("tcp://", 0) == 0;
  const bool curve = inServerKey.empty() || (inServerKey.size() == 40 && !mOptions.mCurveSecretKey.empty());
  TARN_REMOTE_CONTRACT_CHECK(!inStationID.empty(), "Tarn::Remote::Node::Import");
  TARN_REMOTE_CONTRACT_CHECK(known, "Tarn::Remote::Node::Import");
  TARN_REMOTE_CONTRACT_CHECK(curve, "Tarn::Remote::Node::Import");
  if (inStationID.empty() || !known || !curve) return;
  {
    std::lock_guard<std::mutex> lock(mQueueMutex);
    mCommands.push_back(Command{Command::Kind::kImport, inStationID, inEndpoint, inServerKey});
  }
  Wake();
}

NodeStats Node::Impl::GetStats() const noexcept {
  NodeStats stats;
  stats.mExported = mCounters.mExported.load(std::memory_order_relaxed);
  stats.mExportDropped = mCounters.mExportDropped.load(std::memory_order_relaxed);
  stats.mImported = mCounters.mImported.load(std::memory_order_relaxed);
  stats.mLost = mCounters.mLost.load(std::memory_order_relaxed);
  stats.mUnknown = mCounters.mUnknown.load(std::memory_order_relaxed);
  stats.mMalformed = mCounters.mMalformed.load(std::memory_order_relaxed);
  stats.mDuplicates = mCounters.mDuplicates.load(std::memory_order_relaxed);
  stats.mImportErrors = mCounters.mImportErrors.load(std::memory_order_relaxed);
  stats.mRefusedPeers = mCounters.mRefusedPeers.load(std::memory_order_relaxed);
  stats.mMainThreadBehind = mCounters.mBehind.load(std::memory_order_relaxed);
  return stats;
}

// Main thread, inside a broadcast on the station: encode, queue, never wait.
void Node::Impl::Enqueue(ExportListener& ioListener, const Message& inMessage) {
  if (&inMessage == sDelivering) return;
  const WireType* type = FindWireType(inMessage.GetMessageID());
  if (type == nullptr) return;
  // The number is taken before the queue may drop the message, so that
  // importers see the drop as a gap.
  const Envelope envelope{mOrigin, ++ioListener.mSequence, 0};
  Outgoing outgoing{ioListener.mTopic, std::string(), envelope.mSequence, type, nullptr};
  try {
    mCodec->Encode(envelope, *type, inMessage, outgoing.mBytes);
    // Kept whole, since a snapshot goes out under an envelope of its own.
    if (type->mKind == WireKind::kState) outgoing.mState.reset(inMessage.Clone());
  } catch (const std::bad_alloc&) {
    mCounters.mExportDropped.fetch_add(1, std::memory_order_relaxed);
    return;
  }
  bool wasEmpty = false;
  {
    std::lock_guard<std::mutex> lock(mQueueMutex);
    if (mQueue.size() >= mOptions.mQueueCapacity) {
      mCounters.mExportDropped.fetch_add(1, std::memory_order_relaxed);
      return;
    }
    wasEmpty = mQueue.empty();
    mQueue.push_back(std::move(outgoing));
  }
  // The I/O thread takes the whole queue each time it wakes, so only the
  // first message into an empty queue needs to wake it.
  if (wasEmpty) Wake();
}

void Node::Impl::Wake() noexcept {
  const std::uint64_t one = 1;
  // EAGAIN means the counter is already far from zero: the thread is awake.
  [[maybe_unused]] const ssize_t written = ::write(mWakeDescriptor, &one, sizeof(one));
}

void Node::Impl::Run(std::promise<void>& outBound) noexcept {
  // The context is made first and destroyed last: its destruction waits,
  // up to each socket's linger, for what they still hold to leave.
  zmq::context_t context(1);
  bool announced = false;
  try {
    // The authentication handler of this context: every importer's
    // connection is put to it (the publisher names a domain) before any
    // message reaches the importer.
    zmq::socket_t authenticator(context, zmq::socket_type::rep);
    authenticator.set(zmq::sockopt::linger, 0);
    authenticator.bind("inproc://zeromq.zap.01");
    zmq::socket_t publisher(context, zmq::socket_type::xpub);
    publisher.set(zmq::sockopt::zap_domain, "tarn.remote");
    if (!mOptions.mCurveSecretKey.empty()) {
      publisher.set(zmq::sockopt::curve_server, 1);
      publisher.set(zmq::sockopt::curve_secretkey, mOptions.mCurveSecretKey);
    }
    publisher.set(zmq::sockopt::sndhwm, mOptions.mSendHighWaterMark);
    publisher.set(zmq::sockopt::linger, mOptions.mLingerMilliseconds);
    // Every subscription and unsubscription comes up, one per importer, so
    // that importers can be counted.
    publisher.set(zmq::sockopt::xpub_verboser, 1);
    publisher.set(zmq::sockopt::xpub_manual, 1);
    try {
      publisher.bind(mEndpoint);
      mEndpoint = publisher.get(zmq::sockopt::last_endpoint);  // read by the constructor once told
    } catch (const zmq::error_t& inError) {
      announced = true;
      outBound.set_exception(std::make_exception_ptr(
          std::runtime_error("Tarn::Remote: cannot bind " + mEndpoint + ": " + inError.what())));
      return;
    }
    outBound.set_value();
    announced = true;
    RunLoop(context, publisher, authenticator);
  } catch (...) {
    // Before the bind, the constructor throws this; after it, only storage
    // running out ends up here, and the node's thread stops.
    if (!announced) outBound.set_exception(std::current_exception());
  }
  mImports.clear();
}

void Node::Impl::RunLoop(zmq::context_t& ioContext, zmq::socket_t& ioPublisher, zmq::socket_t& ioAuthenticator) {
  std::vector<zmq::pollitem_t> items;
  std::vector<ImportSocket*> polled;
  for (;;) {
    items.clear();
    polled.clear();
    items.push_back(zmq::pollitem_t{nullptr, mWakeDescriptor, ZMQ_POLLIN, 0});
    items.push_back(zmq::pollitem_t{ioPublisher.handle(), 0, ZMQ_POLLIN, 0});
    items.push_back(zmq::pollitem_t{ioAuthenticator.handle(), 0, ZMQ_POLLIN, 0});
    for (auto& [endpoint, import] : mImports) {
      items.push_back(zmq::pollitem_t{import.mSocket.handle(), 0, ZMQ_POLLIN, 0});
      items.push_back(zmq::pollitem_t{import.mMonitor.handle(), 0, ZMQ_POLLIN, 0});
      polled.push_back(&import);
    }
    zmq::poll(items.data(), items.size(),
              std::chrono::milliseconds(std::max(10, std::min(mOptions.mHeartbeatMilliseconds,
                                                              mOptions.mSuspectAfterMilliseconds / 4))));
    const Clock::time_point now = Clock::now();
    Beat(ioPublisher, now);
    Suspect(now);
    ReportDropped();

    if ((items[0].revents & ZMQ_POLLIN) != 0) {
      std::uint64_t count = 0;
      [[maybe_unused]] const ssize_t got = ::read(mWakeDescriptor, &count, sizeof(count));
      std::deque<Outgoing> outgoing;
      std::vector<Command> commands;
      bool stopping = false;
      {
        std::lock_guard<std::mutex> lock(mQueueMutex);
        outgoing.swap(mQueue);
        commands.swap(mCommands);
        stopping = mStopping;
      }
      Obey(ioContext, commands);
      Send(ioPublisher, outgoing);
      if (stopping) return;
    }
    if ((items[1].revents & ZMQ_POLLIN) != 0) HearSubscriptions(ioPublisher);
    if ((items[2].revents & ZMQ_POLLIN) != 0) Authenticate(ioAuthenticator);
    for (std::size_t i = 0; i < polled.size(); ++i) {
      if ((items[2 * i + 3].revents & ZMQ_POLLIN) != 0) HearImports(*polled[i]);
      if ((items[2 * i + 4].revents & ZMQ_POLLIN) != 0) HearMonitor(*polled[i]);
    }
  }
}

void Node::Impl::Beat(zmq::socket_t& ioPublisher, Clock::time_point inNow) {
  if (inNow < mNextBeat) return;
  mNextBeat = inNow + std::chrono::milliseconds(mOptions.mHeartbeatMilliseconds);
  if (!mMainThreadAnswered->exchange(false)) return;
  ioPublisher.send(zmq::buffer(kHeartbeatTopic), zmq::send_flags::dontwait);
  const std::shared_ptr<std::atomic<bool>> answered = mMainThreadAnswered;
  kivcore::threads::AsyncCallFromMainThread([answered] { answered->store(true); }, 0);
}

void Node::Impl::Suspect(Clock::time_point inNow) {
  const auto silence = std::chrono::milliseconds(mOptions.mSuspectAfterMilliseconds);
  for (auto& [endpoint, import] : mImports) {
    if (import.mState == PeerState::State::kLive && inNow - import.mLastHeard > silence) {
      ChangeState(import, PeerState::State::kSuspect);
    }
  }
}

void Node::Impl::ChangeState(ImportSocket& ioImport, PeerState::State inState) {
  if (inState == ioImport.mState) return;
  ioImport.mState = inState;
  for (const auto& [topic, station] : ioImport.mStations) AnnouncePeer(ioImport, station);
}

void Node::Impl::Send(zmq::socket_t& ioPublisher, std::deque<Outgoing>& ioOutgoing) {
  for (Outgoing& outgoing : ioOutgoing) {
    // A publishing socket never blocks: a peer over its high-water mark
    // loses the message, and sees the gap.
    ioPublisher.send(zmq::buffer(*outgoing.mTopic), zmq::send_flags::sndmore | zmq::send_flags::dontwait);
    ioPublisher.send(zmq::buffer(outgoing.mBytes), zmq::send_flags::dontwait);
    mCounters.mExported.fetch_add(1, std::memory_order_relaxed);
    Sent& sent = mSent[*outgoing.mTopic];
    sent.mSequence = outgoing.mSequence;
    if (outgoing.mState != nullptr) sent.mStates[outgoing.mType->mWireName] = {outgoing.mType, outgoing.mState};
  }
}

// To every importer of the topic: a publisher cannot address one. Those
// that heard the values already recognise the snapshot and drop it.
void Node::Impl::SendSnapshot(zmq::socket_t& ioPublisher, const std::string& inTopic) {
  const auto sent = mSent.find(inTopic);
  if (sent == mSent.end() || sent->second.mStates.empty()) return;
  const Envelope envelope{mOrigin, sent->second.mSequence, ++mSnapshots};
  std::string bytes;
  for (const auto& [name, state] : sent->second.mStates) {
    mCodec->Encode(envelope, *state.first, *state.second, bytes);
    ioPublisher.send(zmq::buffer(inTopic), zmq::send_flags::sndmore | zmq::send_flags::dontwait);
    ioPublisher.send(zmq::buffer(bytes), zmq::send_flags::dontwait);
  }
}

void Node::Impl::Obey(zmq::context_t& ioContext, std::vector<Command>& ioCommands) {
  for (Command& command : ioCommands) {
    const std::string topic = TopicOf(command.mStationID);
    if (command.mKind == Command::Kind::kExport) {
      // Importers may have subscribed before the export was known here.
      const auto counted = mImporters.find(topic);
      if (mExportedTopics.insert(topic).second && counted != mImporters.end() && counted->second > 0) {
        AnnounceImporters(command.mStationID, counted->second);
      }
      continue;
    }
    auto found = mImports.find(command.mEndpoint);
    if (found == mImports.end()) {
      try {
        zmq::socket_t socket(ioContext, zmq::socket_type::sub);
        socket.set(zmq::sockopt::rcvhwm, mOptions.mReceiveHighWaterMark);
        socket.set(zmq::sockopt::linger, 0);
        // A restarted exporter is found again within this, plus its start.
        socket.set(zmq::sockopt::reconnect_ivl, kReconnectMilliseconds);
        if (!command.mServerKey.empty()) {
          socket.set(zmq::sockopt::curve_serverkey, command.mServerKey);
          socket.set(zmq::sockopt::curve_publickey, mOptions.mCurvePublicKey);
          socket.set(zmq::sockopt::curve_secretkey, mOptions.mCurveSecretKey);
        }
        const std::string monitorAddress =
            "inproc://tarn-remote-monitor-" + std::to_string(mOrigin) + "-" + std::to_string(++mMonitors);
        if (zmq_socket_monitor(socket.handle(), monitorAddress.c_str(),
                               ZMQ_EVENT_HANDSHAKE_SUCCEEDED | ZMQ_EVENT_DISCONNECTED) != 0) {
          throw zmq::error_t();
        }
        zmq::socket_t monitor(ioContext, zmq::socket_type::pair);
        monitor.set(zmq::sockopt::linger, 0);
        monitor.connect(monitorAddress);
        socket.connect(command.mEndpoint);
        socket.set(zmq::sockopt::subscribe, kHeartbeatTopic);
        found = mImports
                    .emplace(command.mEndpoint,
                             ImportSocket{command.mEndpoint, std::move(socket), std::move(monitor), {},
                                          PeerState::State::kConnecting, Clock::now()})
                    .first;
      } catch (const zmq::error_t&) {
        mCounters.mImportErrors.fetch_add(1, std::memory_order_relaxed);
        continue;
      }
    }
    if (found->second.mStations.emplace(topic, command.mStationID).second) {
      found->second.mSocket.set(zmq::sockopt::subscribe, topic);
      AnnouncePeer(found->second, command.mStationID);
    }
  }
}

// One request of the authentication protocol: version, request ID, domain,
// address, routing ID, mechanism and the mechanism's credentials; answered
// with version, request ID, status code and text, user ID and metadata.
void Node::Impl::Authenticate(zmq::socket_t& ioHandler) {
  std::vector<zmq::message_t> request;
  do {
    request.emplace_back();
    if (!ioHandler.recv(request.back(), zmq::recv_flags::dontwait)) return;
  } while (request.back().more() && request.size() < 16);
  while (request.back().more()) (void)ioHandler.recv(request.back(), zmq::recv_flags::none);
  bool allowed = false;
  std::string user;  // what the peer's messages carry as their "User-Id"
  if (request.size() >= 7 && request[5].to_string() == "CURVE" && request[6].size() == 32) {
    // The client's long-term public key, proven by the handshake.
    char text[41] = {};
    zmq_z85_encode(text, static_cast<const std::uint8_t*>(request[6].data()), 32);
    const std::vector<std::string>& keys = mOptions.mAllowedCurveKeys;
    allowed = std::find(keys.begin(), keys.end(), std::string(text)) != keys.end();
    user = std::string("curve:") + text;
  } else if (request.size() >= 6 && request[5].to_string() == "NULL") {
    allowed = IsAllowed(request[3].to_string(), user);
  }
  if (!allowed) mCounters.mRefusedPeers.fetch_add(1, std::memory_order_relaxed);
  const std::string version = "1.0";
  const std::string requestID = request.size() >= 2 ? request[1].to_string() : std::string();
  const std::string code = allowed ? "200" : "400";
  const std::string text = allowed ? "OK" : "not an allowed user";
  ioHandler.send(zmq::buffer(version), zmq::send_flags::sndmore);
  ioHandler.send(zmq::buffer(requestID), zmq::send_flags::sndmore);
  ioHandler.send(zmq::buffer(code), zmq::send_flags::sndmore);
  ioHandler.send(zmq::buffer(text), zmq::send_flags::sndmore);
  ioHandler.send(zmq::buffer(user), zmq::send_flags::sndmore);
  ioHandler.send(zmq::str_buffer(""), zmq::send_flags::none);
}

// A Unix socket peer's address ends in ":UID:GID:PID", which libzmq reads
// from the socket (SO_PEERCRED); the kernel vouches for it. A peer without
// one (over tcp) has nothing to check.
bool Node::Impl::IsAllowed(const std::string& inAddress, std::string& outUser) const {
  const std::size_t pid = inAddress.rfind(':');
  const std::size_t gid = pid == std::string::npos || pid == 0 ? std::string::npos : inAddress.rfind(':', pid - 1);
  const std::size_t uid = gid == std::string::npos || gid == 0 ? std::string::npos : inAddress.rfind(':', gid - 1);
  if (uid == std::string::npos) return mOptions.mAcceptPeersWithoutCredentials;
  const std::string text = inAddress.substr(uid + 1, gid - uid - 1);
  if (text.empty() || text.find_first_not_of("0123456789") != std::string::npos) return false;
  const unsigned long user = std::stoul(text);
  outUser = text;
  const std::vector<uid_t>& allowed = mAllowedUsers;
  return std::find(allowed.begin(), allowed.end(), static_cast<uid_t>(user)) != allowed.end();
}

// Whether the user the authentication handler named may hear the topic: a
// station with an allow list of its own takes only the users on it.
bool Node::Impl::StationAllows(const std::string& inTopic, const std::string& inUser) const {
  const auto listed = mOptions.mStationUsers.find(inTopic.substr(0, inTopic.size() - 1));
  if (listed == mOptions.mStationUsers.end()) return true;
  if (inUser.empty() || inUser.find_first_not_of("0123456789") != std::string::npos) return false;
  const uid_t user = static_cast<uid_t>(std::stoul(inUser));
  return std::find(listed->second.begin(), listed->second.end(), user) != listed->second.end();
}

void Node::Impl::HearSubscriptions(zmq::socket_t& ioPublisher) {
  zmq::message_t frame;
  while (ioPublisher.recv(frame, zmq::recv_flags::dontwait)) {
    // A subscription frame: 1 (subscribe) or 0 (unsubscribe), then the topic.
    if (frame.size() < 2) continue;
    const char* data = static_cast<const char*>(frame.data());
    const std::string topic(data + 1, frame.size() - 1);
    if (topic.back() != '\0' || (data[0] != 0 && data[0] != 1)) continue;
    // The publisher takes subscriptions only as told (manual mode), each for
    // the importer whose frame was read last: one of a user the station
    // does not allow never reaches its list.
    std::string user;
    try {
      user = frame.gets("User-Id");
    } catch (const zmq::error_t&) {  // no such property: no user known
    }
    if (!StationAllows(topic, user)) {
      if (data[0] == 1) mCounters.mRefusedPeers.fetch_add(1, std::memory_order_relaxed);
      continue;
    }
    if (data[0] == 1) {
      ioPublisher.set(zmq::sockopt::subscribe, topic);
    } else {
      ioPublisher.set(zmq::sockopt::unsubscribe, topic);
    }
    // Counted for every topic, exported yet or not: an importer may
    // subscribe before the export command reaches this thread. Topics no
    // importer holds any more are forgotten, so that the map stays bounded
    // by what importers hold.
    std::uint32_t& importers = mImporters[topic];
    if (data[0] == 1) {
      ++importers;
      SendSnapshot(ioPublisher, topic);
    } else if (importers > 0) {
      --importers;
    }
    const std::uint32_t now = importers;
    if (now == 0) mImporters.erase(topic);
    if (mExportedTopics.count(topic) != 0) {
      AnnounceImporters(ImmutableString::CreateDynamic(std::string_view(topic.data(), topic.size() - 1)), now);
    }
  }
}

void Node::Impl::AnnounceImporters(const ImmutableString& inStationID, std::uint32_t inImporters) {
  auto changed = std::make_shared<ImportersChanged>();
  changed->mImporters = inImporters;
  Deliver(inStationID, std::move(changed), Bound::kAlways);
}

void Node::Impl::HearImports(ImportSocket& ioImport) {
  zmq::message_t topic;
  zmq::message_t body;
  // A batch at a time, so that one busy exporter does not starve the
  // others or the export queue.
  for (int batch = 0; batch < 256; ++batch) {
    if (!ioImport.mSocket.recv(topic, zmq::recv_flags::dontwait)) return;
    bool wellFormed = topic.more();
    if (wellFormed) {
      (void)ioImport.mSocket.recv(body, zmq::recv_flags::none);  // the parts of a message arrive together
    }
    while (body.more()) {
      wellFormed = false;
      (void)ioImport.mSocket.recv(body, zmq::recv_flags::none);
    }
    // Anything heard clears a suspicion: the exporter's main thread runs.
    if (ioImport.mState == PeerState::State::kSuspect) ChangeState(ioImport, PeerState::State::kLive);
    ioImport.mLastHeard = Clock::now();
    if (topic.size() == kHeartbeatTopic.size() && topic.to_string() == kHeartbeatTopic) continue;
    const auto station = ioImport.mStations.find(topic.to_string());
    if (station == ioImport.mStations.end()) {
      // Not a station imported from here: no station to report it on.
      mCounters.mMalformed.fetch_add(1, std::memory_order_relaxed);
      continue;
    }
    if (!wellFormed) {
      mCounters.mMalformed.fetch_add(1, std::memory_order_relaxed);
      Report(station->second, RemoteLoss::Reason::kMalformed, 0, 1, std::string());
      continue;
    }
    Receive(station->second, body);
  }
}

void Node::Impl::HearMonitor(ImportSocket& ioImport) {
  zmq::message_t event;
  zmq::message_t address;
  while (ioImport.mMonitor.recv(event, zmq::recv_flags::dontwait)) {
    // An event is two frames: its number and value (6 bytes), then the
    // peer's address.
    while (event.more() && ioImport.mMonitor.recv(address, zmq::recv_flags::none) && address.more()) {
    }
    if (event.size() < sizeof(std::uint16_t)) continue;
    std::uint16_t number = 0;
    std::memcpy(&number, event.data(), sizeof(number));
    ioImport.mLastHeard = Clock::now();
    ChangeState(ioImport, number == ZMQ_EVENT_HANDSHAKE_SUCCEEDED ? PeerState::State::kLive
                                                                  : PeerState::State::kLost);
  }
}

void Node::Impl::AnnouncePeer(const ImportSocket& inImport, const ImmutableString& inStationID) {
  auto state = std::make_shared<PeerState>();
  state->mState = inImport.mState;
  state->mEndpoint = inImport.mEndpoint;
  Deliver(inStationID, std::move(state), Bound::kAlways);
}

// I/O thread: decode, account for the sequence, hand to the main thread.
void Node::Impl::Receive(const ImmutableString& inStationID, const zmq::message_t& inBody) {
  Decoded decoded = mCodec->Decode(inBody.data(), inBody.size());
  if (decoded.mHasEnvelope && !Admit(inStationID, decoded.mEnvelope)) return;
  switch (decoded.mStatus) {
    case DecodeStatus::kDecoded:
      mCounters.mImported.fetch_add(1, std::memory_order_relaxed);
      Deliver(inStationID, std::shared_ptr<const Message>(std::move(decoded.mMessage)));
      return;
    case DecodeStatus::kUnknownType:
    case DecodeStatus::kUnknownVersion:
      mCounters.mUnknown.fetch_add(1, std::memory_order_relaxed);
      Report(inStationID,
             decoded.mStatus == DecodeStatus::kUnknownType ? RemoteLoss::Reason::kUnknownType
                                                           : RemoteLoss::Reason::kUnknownVersion,
             decoded.mEnvelope.mOrigin, 1, decoded.mWireName);
      return;
    case DecodeStatus::kMalformed:
      mCounters.mMalformed.fetch_add(1, std::memory_order_relaxed);
      Report(inStationID, RemoteLoss::Reason::kMalformed, decoded.mHasEnvelope ? decoded.mEnvelope.mOrigin : 0, 1,
             std::string());
      return;
  }
}

// The sequence rules: whether a message of this envelope is taken in (or
// reported as refused) rather than dropped, with a gap reported first.
bool Node::Impl::Admit(const ImmutableString& inStationID, const Envelope& inEnvelope) {
  if (inEnvelope.mOrigin == mOrigin || inEnvelope.mSequence == 0) {
    // Our own message come back, or no sequence at all: never delivered.
    mCounters.mDuplicates.fetch_add(1, std::memory_order_relaxed);
    return false;
  }
  if (mTracks.size() >= kMaxTrackedOrigins) mTracks.clear();
  Track& track = mTracks[{inEnvelope.mOrigin, std::string(inStationID.c_str(), inStationID.size())}];
  const bool known = track.mLast != 0;
  // A snapshot carries the last number sent before it: what lies between
  // ours and it was missed, a live message one past ours is the next.
  const std::uint64_t next = inEnvelope.mSnapshot != 0 ? inEnvelope.mSequence : inEnvelope.mSequence - 1;
  if (inEnvelope.mSnapshot != 0) {
    const bool continuing = known && inEnvelope.mSnapshot == track.mSnapshot;
    if (!continuing && known && inEnvelope.mSequence <= track.mLast) {
      return false;  // another importer's snapshot of what we heard already
    }
    track.mSnapshot = inEnvelope.mSnapshot;
  } else {
    if (known && inEnvelope.mSequence <= track.mLast) {
      mCounters.mDuplicates.fetch_add(1, std::memory_order_relaxed);
      return false;
    }
    track.mSnapshot = 0;
  }
  if (known && next > track.mLast) {
    const std::uint64_t lost = next - track.mLast;
    mCounters.mLost.fetch_add(lost, std::memory_order_relaxed);
    Report(inStationID, RemoteLoss::Reason::kGap, inEnvelope.mOrigin, lost, std::string());
  }
  track.mLast = std::max(track.mLast, inEnvelope.mSequence);
  return true;
}

void Node::Impl::Report(const ImmutableString& inStationID, RemoteLoss::Reason inReason, std::uint64_t inOrigin,
                        std::uint64_t inCount, const std::string& inWireName) {
  auto report = std::make_shared<RemoteLoss>();
  report->mReason = inReason;
  report->mOrigin = inOrigin;
  report->mCount = inCount;
  report->mWireName = inWireName;
  Deliver(inStationID, std::move(report));
}

// Reports and messages take the same queue, so that a report comes before
// the message that revealed the loss.
void Node::Impl::Deliver(const ImmutableString& inStationID, std::shared_ptr<const Message> inMessage,
                         Bound inBound) {
  std::shared_ptr<std::atomic<std::size_t>> backlog;
  if (inBound == Bound::kBounded) {
    if (mBacklog->load(std::memory_order_acquire) >= mOptions.mQueueCapacity) {
      ++mDropped[inStationID];
      mCounters.mBehind.fetch_add(1, std::memory_order_relaxed);
      return;
    }
    ReportDropped();
    mBacklog->fetch_add(1, std::memory_order_acq_rel);
    backlog = mBacklog;
  }
  kivcore::threads::AsyncCallFromMainThread(
      [inStationID, inMessage, backlog] {
        // Restored on the way out, also by a throw: a handler may run the
        // pending calls, and with them another delivery, from inside this one.
        struct Marked {
          const Message* mOuter = sDelivering;
          std::atomic<std::size_t>* mBacklog;
          ~Marked() {
            sDelivering = mOuter;
            if (mBacklog != nullptr) mBacklog->fetch_sub(1, std::memory_order_acq_rel);
          }
        } marked{sDelivering, backlog.get()};
        sDelivering = inMessage.get();
        StationUtils::BroadcastMessage(inStationID, *inMessage);
      },
      0);
}

void Node::Impl::ReportDropped() {
  if (mDropped.empty() || mBacklog->load(std::memory_order_acquire) >= mOptions.mQueueCapacity) return;
  std::map<ImmutableString, std::uint64_t> dropped;
  dropped.swap(mDropped);
  for (const auto& [station, count] : dropped) {
    auto report = std::make_shared<RemoteLoss>();
    report->mReason = RemoteLoss::Reason::kMainThreadBehind;
    report->mCount = count;
    // Past the bound by one report per station at most.
    Deliver(station, std::move(report), Bound::kAlways);
  }
}

std::pair<std::string, std::string> Node::MakeCurveKeyPair() {
  char publicKey[41] = {};
  char secretKey[41] = {};
  if (zmq_curve_keypair(publicKey, secretKey) != 0) {
    throw std::runtime_error("Tarn::Remote: libzmq cannot make CURVE keys (built without CURVE)");
  }
  return {publicKey, secretKey};
}

Node::Node(NodeOptions inOptions) : mImpl(std::make_unique<Impl>(std::move(inOptions))) {}
Node::~Node() = default;
void Node::Export(const ImmutableString& inStationID) { mImpl->Export(inStationID); }
void Node::Import(const ImmutableString& inStationID, const std::string& inEndpoint) {
  mImpl->Import(inStationID, inEndpoint, std::string());
}
void Node::Import(const ImmutableString& inStationID, const std::string& inEndpoint, const std::string& inServerKey) {
  mImpl->Import(inStationID, inEndpoint, inServerKey);
}
const std::string& Node::GetEndpoint() const noexcept { return mImpl->Endpoint(); }
std::uint64_t Node::GetOrigin() const noexcept { return mImpl->Origin(); }
NodeStats Node::GetStats() const noexcept { return mImpl->GetStats(); }

}  // namespace Tarn::Remote
