/// @file
/// Tarn::Remote::Node: a process's end of stations shared with other
/// processes. A node exports stations (what is broadcast on them goes to the
/// processes that import them) and imports stations of other nodes (what
/// their processes broadcast is broadcast here too, on the main thread).
///
/// @code{.cpp}
///   // The host process:
///   Tarn::Remote::Node node(Tarn::Remote::NodeOptions("host"));
///   node.Export(kStation_Jobs);                          // its endpoint: node.GetEndpoint()
///   // A plug-in process:
///   Tarn::Remote::Node plugin(Tarn::Remote::NodeOptions("plugin"));
///   plugin.Import(kStation_Jobs, Tarn::Remote::Node::DefaultEndpoint("host"));
///   Tarn::Registration r = Tarn::Subscribe<Progress>(kStation_Jobs, [](const Progress& inProgress) { ... });
/// @endcode
///
/// Only wire-enabled message types travel (WireMessage.h); a node ignores
/// the others. A station may be exported by one node and imported by it
/// from another at once (two-way): a message a node delivers from an import
/// is not exported again, by any node of the process, so nothing echoes
/// back to where it came from; a process does not relay one node's
/// messages on to a third.
///
/// Guarantees, per origin (a sending node) and station: messages arrive in
/// the order they were broadcast, each at most once. Every loss is detected
/// by sequence numbers and reported on the station as a RemoteLoss with the
/// number lost, before the next message that arrives: a message dropped by
/// the exporter's queue or by a socket's high-water mark, and a message
/// refused by the decoder (unknown wire name or version, malformed). The
/// first message heard from an origin starts its count: what it broadcast
/// before the import was connected is not reported.
///
/// Snapshots: of each state-like type (TARN_WIRE_STATE), an exporting node
/// keeps the latest value it sent on each station, and sends them again when
/// an importer subscribes (first connection or reconnection), before any
/// later message. The importer that subscribed takes them in (reporting as a
/// gap what it missed before them, if it had heard that origin before);
/// importers that heard everything already drop them, so no value is
/// delivered twice to one node. Not guaranteed: delivery
/// of what is broadcast before an importer is connected (wait for an
/// ImportersChanged on the exporting side), and order between origins.
///
/// Endpoints and peers: by default a node publishes on an ipc:// endpoint
/// named after it, in a directory that only this user may enter (mode 0700,
/// owned by the user): $XDG_RUNTIME_DIR/tarn-remote, or /tmp/tarn-remote-UID
/// without one. A directory of another owner or mode is refused. Whatever
/// the endpoint, every connection to it is authenticated before it hears
/// anything: over a Unix socket the kernel tells the peer's user
/// (SO_PEERCRED, through ZeroMQ's authentication handler), which must be in
/// NodeOptions::mAllowedUsers (by default this process's user only). Across
/// machines, over tcp, give the node a CURVE key pair: its connections are
/// then encrypted, and a peer must present a key of
/// NodeOptions::mAllowedCurveKeys. A tcp peer without CURVE has no
/// credentials and is refused unless
/// NodeOptions::mAcceptPeersWithoutCredentials. Refusals are counted
/// (NodeStats::mRefusedPeers).
///
/// Threading: one I/O thread per node owns every socket; sockets are never
/// touched by another thread. Export, Import, GetStats and the accessors may
/// be called from any thread. A broadcast on an exported station (on the
/// main thread, as every broadcast) encodes the message and hands it to the
/// I/O thread through a bounded queue; it never blocks on the I/O thread or
/// the network: when the queue is full the message is dropped and counted
/// (NodeStats::mExportDropped), and importers report the gap. Imported
/// messages, ImportersChanged and RemoteLoss reports are handed to the main
/// thread's queue of pending calls (kivcore's AsyncCallFromMainThread) and
/// broadcast on the station there, so handlers run on the importer's main
/// thread, through whatever event-loop integration runs that queue. A main
/// thread that falls behind holds at most NodeOptions::mQueueCapacity of
/// them: further ones are dropped and reported (kMainThreadBehind) once it
/// has caught up, before the next one it hears.
///
/// Ownership and lifetime: the node owns its sockets, its thread and the
/// listeners it attaches to exported stations. The destructor detaches those
/// listeners (waiting, off the main thread, as RemoveListener does), sends
/// what the export queue holds, waits up to NodeOptions::mLingerMilliseconds
/// for it to leave, and joins the I/O thread. Imported messages already
/// handed to the main thread are still delivered after the node is gone.
#pragma once

#include <TarnMessaging/MessageImpl.h>
#include <TarnMessaging/Remote/Export.h>
#include <TarnMessaging/Remote/WireCodec.h>

#include <kivcore/ImmutableString.h>

#include <cstddef>
#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include <sys/types.h>

namespace Tarn::Remote {

/// How a node is set up. Every field has a usable default.
struct NodeOptions {
  NodeOptions() = default;
  /// Options with mName set and every other field at its default.
  explicit NodeOptions(std::string inName) : mName(std::move(inName)) {}

  /// Names the node's default endpoint (DefaultEndpoint); letters, digits,
  /// '-', '_' and '.' only. Empty: "tarn-" and the process ID.
  std::string mName;
  /// Where exported stations are published; empty: DefaultEndpoint(mName).
  /// "ipc://PATH" or "tcp://HOST:PORT".
  std::string mEndpoint;
  /// Messages waiting, each way: encoded ones for the I/O thread, imported
  /// ones (and loss reports) for the main thread; more are dropped, counted
  /// and reported.
  std::size_t mQueueCapacity = 4096;
  /// Messages a socket holds for one peer before it drops (ZeroMQ's
  /// high-water marks): per importer when sending, per exporter when receiving.
  /// @{
  int mSendHighWaterMark = 10000;
  int mReceiveHighWaterMark = 10000;
  /// @}
  /// How long the destructor waits for queued messages to leave.
  int mLingerMilliseconds = 200;
  /// How often this node tells its importers that its main thread runs (a
  /// heartbeat goes out only once the main thread has run the call the last
  /// one posted).
  int mHeartbeatMilliseconds = 500;
  /// How long an import may hear nothing, heartbeats included, before its
  /// exporter is declared suspect. Declared within this plus a quarter of it.
  int mSuspectAfterMilliseconds = 3000;
  /// The users whose processes may import from this node, by user ID;
  /// empty: this process's effective user only.
  std::vector<uid_t> mAllowedUsers;
  /// Per station ID, the users (among mAllowedUsers) that may import it; a
  /// station not named here may be imported by every allowed user. A peer
  /// over CURVE has no user ID, and may import only unnamed stations.
  std::map<std::string, std::vector<uid_t>> mStationUsers;
  /// Whether a peer whose user cannot be known (over tcp, without CURVE)
  /// may import.
  bool mAcceptPeersWithoutCredentials = false;
  /// This node's CURVE key pair (Node::MakeCurveKeyPair, Z85 text), for
  /// tcp across machines: with it, this node's endpoint encrypts and
  /// authenticates every connection (a peer must know mCurvePublicKey and be
  /// among mAllowedCurveKeys), and its imports given a server key present
  /// this pair. Empty: no CURVE.
  /// @{
  std::string mCurvePublicKey;
  std::string mCurveSecretKey;
  /// @}
  /// The public keys (Z85) of the peers that may import over CURVE.
  std::vector<std::string> mAllowedCurveKeys;
  /// The codec of this node's messages; null: MakeMsgPackCodec().
  std::shared_ptr<const WireCodec> mCodec;
};

/// A node's counters since it was made; each is read on its own (relaxed).
struct NodeStats {
  std::uint64_t mExported = 0;        ///< messages handed to the socket
  std::uint64_t mExportDropped = 0;   ///< dropped because the export queue was full
  std::uint64_t mImported = 0;        ///< messages decoded, then handed to the main thread or dropped
  std::uint64_t mMainThreadBehind = 0;  ///< of those, dropped: the main thread had the queue capacity waiting
  std::uint64_t mLost = 0;            ///< messages of other nodes found missing by sequence number
  std::uint64_t mUnknown = 0;         ///< refused: unknown wire name or version
  std::uint64_t mMalformed = 0;       ///< refused: bytes that are not a message
  std::uint64_t mDuplicates = 0;      ///< dropped: a sequence number already seen
  std::uint64_t mImportErrors = 0;    ///< imports whose endpoint could not be connected
  std::uint64_t mRefusedPeers = 0;    ///< connections and subscriptions refused: not an allowed user
};

/// Reported on a station for every loss an importing node detects, before
/// the next message of that origin.
struct RemoteLoss : MessageImpl<RemoteLoss> {
  /// Why messages were lost.
  enum class Reason : std::int32_t {
    kGap,             ///< sequence numbers skipped: lost on the way (a queue or a high-water mark)
    kUnknownType,     ///< a wire name not registered here (mWireName)
    kUnknownVersion,  ///< a version of mWireName other than this process's
    kMalformed,       ///< bytes that are not a message
    kMainThreadBehind,  ///< imported here, but the main thread had NodeOptions::mQueueCapacity waiting already
  };
  Reason mReason = Reason::kGap;  ///< why
  std::uint64_t mOrigin = 0;  ///< the sending node; 0 when not even the envelope could be read
  std::uint64_t mCount = 0;   ///< messages lost
  std::string mWireName;      ///< for kUnknownType and kUnknownVersion
};

/// Broadcast on an exported station, on the exporting node's main thread,
/// when the number of importers subscribed to it changes.
struct ImportersChanged : MessageImpl<ImportersChanged> {
  std::uint32_t mImporters = 0;  ///< importers subscribed to the station now
};

/// Broadcast on an imported station, on the importing node's main thread,
/// when the connection to the node it is imported from changes: kConnecting
/// when the import starts, kLive once connected (again), kSuspect when
/// nothing came for NodeOptions::mSuspectAfterMilliseconds, not even a
/// heartbeat (its main thread is stuck, or the process is stopped), kLive
/// again when something comes, kLost when the connection is gone. A lost
/// node is sought again every 50 ms, and a node restarted at the same
/// endpoint is live again as soon as it has bound it.
struct PeerState : MessageImpl<PeerState> {
  /// The connection's state, as described above.
  enum class State : std::int32_t { kConnecting, kLive, kSuspect, kLost };
  State mState = State::kConnecting;  ///< the state entered
  std::string mEndpoint;  ///< the endpoint imported from
};

/// One process's end of stations shared with other processes; see the file
/// comment. Not copyable.
class TARN_REMOTE_API Node {
public:
  /// Starts the I/O thread and binds the node's endpoint. Throws
  /// std::runtime_error naming the endpoint when it cannot be bound, or when
  /// the default endpoint's directory is unsafe; nothing is left running then.
  explicit Node(NodeOptions inOptions = NodeOptions());
  /// See Ownership and lifetime above.
  ~Node();
  Node(const Node&) = delete;
  Node& operator=(const Node&) = delete;

  /// Exports the station: what is broadcast on it from now on goes to its
  /// importers. Exporting a station again does nothing. A station ID that is
  /// not registered is reported as StationUtils::AddListener reports it.
  /// Precondition: !inStationID.empty().
  void Export(const kivcore::utility::ImmutableString& inStationID);

  /// Imports the station from the node publishing at inEndpoint: what that
  /// node's process broadcasts on it is broadcast here on the main thread.
  /// Returns at once; the I/O thread connects (and reconnects) on its own.
  /// Importing the same station from the same endpoint again does nothing.
  /// Preconditions: !inStationID.empty(), inEndpoint starts with "ipc://" or
  /// "tcp://".
  void Import(const kivcore::utility::ImmutableString& inStationID, const std::string& inEndpoint);
  /// The same from a node whose endpoint uses CURVE, with that node's public
  /// key (Z85); this node presents its own key pair, which must be set.
  /// Preconditions as above, inServerKey.size() == 40, and a CURVE key pair
  /// in this node's options.
  void Import(const kivcore::utility::ImmutableString& inStationID, const std::string& inEndpoint,
              const std::string& inServerKey);

  /// A new CURVE key pair, public then secret, as Z85 text (40 characters
  /// each). Throws std::runtime_error when libzmq was built without CURVE.
  static std::pair<std::string, std::string> MakeCurveKeyPair();

  /// The endpoint exported stations are published on, for importers (a tcp
  /// endpoint bound to port 0 or "*" names the port taken).
  const std::string& GetEndpoint() const noexcept;
  /// This node's origin ID: random, never 0, different for every node.
  std::uint64_t GetOrigin() const noexcept;
  /// The node's counters now.
  NodeStats GetStats() const noexcept;

  /// "ipc://" and the path of inName in the private endpoint directory
  /// (see Endpoints above), which is made if missing. Throws
  /// std::runtime_error when the directory cannot be made or is not private,
  /// or when the path is too long for a socket address.
  /// Precondition: inName is a valid NodeOptions::mName and not empty.
  static std::string DefaultEndpoint(const std::string& inName);

private:
  class Impl;
  std::unique_ptr<Impl> mImpl;
};

}  // namespace Tarn::Remote
