// The other process of the remote suite; each mode is one peer's side of a
// test in RemoteProcessTest.cpp:
//   burst ENDPOINT COUNT CAPACITY   exports test.remote and broadcasts COUNT
//                                   ticks through an export queue of
//                                   CAPACITY, then one more once it drained
//   twoway OWN PARENT COUNT         exports and imports test.twoway, answers
//                                   each of the parent's COUNT ticks with one
//                                   of its own, then reports the echoes heard
//   import OWN ENDPOINT [PUBLIC SECRET SERVER]
//                                   imports test.remote (over CURVE with the
//                                   keys given); exit status 0 once a tick
//                                   came, 3 when not live within 500 ms, 2
//                                   when live but no tick came in 500 ms
//   raw ENDPOINT                    a bare publishing socket sending test.raw
//                                   input no node would send
//   serve ENDPOINT TAG              exports test.remote, broadcasts a tick
//                                   from TAG once imported, then waits to be
//                                   killed (hang: with its main thread stuck,
//                                   and heartbeats every 50 ms until then)
//   state ENDPOINT                  exports test.remote, broadcasts statuses
//                                   1, 2, 3 and says so on standard output
//                                   before any importer comes, then tick N
//                                   once N importers are there (N = 1, 2),
//                                   then waits to be killed
// Every wait is bounded. Exit status 0 when the mode ran, 1 for bad
// arguments, 2 when a wait ran out.
#include "RemoteTestMessages.h"

#include <TarnMessaging.h>
#include <TarnMessaging/Remote/Node.h>

#include <zmq.hpp>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <thread>

namespace {

using kivcore::utility::ImmutableString;
using remote_test::PumpUntil;
using remote_test::Tick;

Tick MakeTick(std::uint64_t inNumber, std::int32_t inSender) {
  Tick tick;
  tick.mNumber = inNumber;
  tick.mSender = inSender;
  return tick;
}

bool Drained(const Tarn::Remote::Node& inNode, std::uint64_t inBroadcast) {
  const Tarn::Remote::NodeStats stats = inNode.GetStats();
  return stats.mExported + stats.mExportDropped == inBroadcast;
}

int Burst(const std::string& inEndpoint, std::uint64_t inCount, std::size_t inCapacity) {
  const ImmutableString station = ImmutableString::CreateStatic("test.remote");
  Tarn::Remote::NodeOptions options;
  options.mEndpoint = inEndpoint;
  options.mQueueCapacity = inCapacity;
  Tarn::Remote::Node node(options);
  std::uint32_t importers = 0;
  const Tarn::Registration heard = Tarn::Subscribe<Tarn::Remote::ImportersChanged>(
      station, [&](const Tarn::Remote::ImportersChanged& inChanged) { importers = inChanged.mImporters; });
  node.Export(station);
  if (!PumpUntil([&] { return importers > 0; })) return 2;
  for (std::uint64_t number = 1; number <= inCount; ++number) {
    Tarn::StationUtils::BroadcastMessage(station, MakeTick(number, 1));
  }
  // The last tick goes into a drained queue, so the queue cannot drop it.
  if (!PumpUntil([&] { return Drained(node, inCount); })) return 2;
  Tarn::StationUtils::BroadcastMessage(station, MakeTick(inCount + 1, 1));
  return PumpUntil([&] { return Drained(node, inCount + 1); }) ? 0 : 2;
}

int TwoWay(const std::string& inOwn, const std::string& inParent, std::uint64_t inCount) {
  const ImmutableString station = ImmutableString::CreateStatic("test.twoway");
  Tarn::Remote::NodeOptions options;
  options.mEndpoint = inOwn;
  Tarn::Remote::Node node(options);
  std::uint32_t importers = 0;
  std::uint64_t fromParent = 0;
  std::uint64_t ownHeard = 0;
  std::uint64_t answered = 0;
  const Tarn::Registration counted = Tarn::Subscribe<Tarn::Remote::ImportersChanged>(
      station, [&](const Tarn::Remote::ImportersChanged& inChanged) { importers = inChanged.mImporters; });
  const Tarn::Registration ticks = Tarn::Subscribe<Tick>(station, [&](const Tick& inTick) {
    if (inTick.mSender == 1) ++ownHeard;
    if (inTick.mSender != 0) return;
    ++fromParent;
    // A new message broadcast from inside the handler of an imported one:
    // it goes out, where the imported one does not.
    ++answered;
    Tarn::StationUtils::BroadcastMessage(station, MakeTick(inTick.mNumber, 1));
  });
  node.Export(station);
  node.Import(station, inParent);
  if (!PumpUntil([&] { return importers > 0; })) return 2;
  Tarn::StationUtils::BroadcastMessage(station, MakeTick(0, 3));  // ready
  if (!PumpUntil([&] { return fromParent == inCount; })) return 2;
  // Each answer was heard here once, locally; any more came back.
  Tarn::StationUtils::BroadcastMessage(station, MakeTick(ownHeard - answered, 2));
  return PumpUntil([&] { return Drained(node, answered + 2); }) ? 0 : 2;
}

int Serve(const std::string& inEndpoint, std::int32_t inTag, bool inHang) {
  const ImmutableString station = ImmutableString::CreateStatic("test.remote");
  Tarn::Remote::NodeOptions options;
  options.mEndpoint = inEndpoint;
  options.mHeartbeatMilliseconds = 50;
  Tarn::Remote::Node node(options);
  std::uint32_t importers = 0;
  const Tarn::Registration heard = Tarn::Subscribe<Tarn::Remote::ImportersChanged>(
      station, [&](const Tarn::Remote::ImportersChanged& inChanged) { importers = inChanged.mImporters; });
  node.Export(station);
  if (!PumpUntil([&] { return importers > 0; })) return 2;
  Tarn::StationUtils::BroadcastMessage(station, MakeTick(1, inTag));
  if (inHang) {
    std::this_thread::sleep_for(std::chrono::seconds(20));  // the I/O thread runs on
  } else {
    PumpUntil([] { return false; }, std::chrono::seconds(20));
  }
  return 2;
}

int State(const std::string& inEndpoint) {
  const ImmutableString station = ImmutableString::CreateStatic("test.remote");
  Tarn::Remote::NodeOptions options;
  options.mEndpoint = inEndpoint;
  Tarn::Remote::Node node(options);
  std::uint32_t importers = 0;
  const Tarn::Registration heard = Tarn::Subscribe<Tarn::Remote::ImportersChanged>(
      station, [&](const Tarn::Remote::ImportersChanged& inChanged) { importers = inChanged.mImporters; });
  node.Export(station);
  for (std::int32_t value = 1; value <= 3; ++value) {
    remote_test::Status status;
    status.mValue = value;
    Tarn::StationUtils::BroadcastMessage(station, status);
  }
  if (!PumpUntil([&] { return Drained(node, 3); }) || importers != 0) return 2;
  std::fputs("sent\n", stdout);
  std::fflush(stdout);
  for (std::uint32_t wanted = 1; wanted <= 2; ++wanted) {
    if (!PumpUntil([&] { return importers >= wanted; })) return 2;
    Tarn::StationUtils::BroadcastMessage(station, MakeTick(wanted, 1));
  }
  PumpUntil([] { return false; }, std::chrono::seconds(20));
  return 2;
}

int Import(char** inArguments, bool inCurve) {
  const ImmutableString station = ImmutableString::CreateStatic("test.remote");
  Tarn::Remote::NodeOptions options;
  options.mEndpoint = inArguments[0];
  if (inCurve) {
    options.mCurvePublicKey = inArguments[2];
    options.mCurveSecretKey = inArguments[3];
  }
  Tarn::Remote::Node node(options);
  bool live = false;
  bool ticked = false;
  const Tarn::Registration heard = Tarn::Subscribe<Tarn::Remote::PeerState>(
      station, [&](const Tarn::Remote::PeerState& inState) { live = inState.mState == Tarn::Remote::PeerState::State::kLive; });
  const Tarn::Registration tick = Tarn::Subscribe<Tick>(station, [&](const Tick&) { ticked = true; });
  if (inCurve) {
    node.Import(station, inArguments[1], inArguments[4]);
  } else {
    node.Import(station, inArguments[1]);
  }
  if (!PumpUntil([&] { return live; }, std::chrono::milliseconds(500))) return 3;
  return PumpUntil([&] { return ticked; }, std::chrono::milliseconds(500)) ? 0 : 2;
}

int Raw(const std::string& inEndpoint) {
  using Tarn::Remote::WireType;
  zmq::context_t context(1);
  zmq::socket_t publisher(context, zmq::socket_type::xpub);
  publisher.set(zmq::sockopt::linger, 2000);
  publisher.bind(inEndpoint);
  zmq::message_t subscription;
  zmq::pollitem_t item{publisher.handle(), 0, ZMQ_POLLIN, 0};
  if (zmq::poll(&item, 1, std::chrono::seconds(10)) == 0 || !publisher.recv(subscription)) return 2;

  const auto codec = Tarn::Remote::MakeMsgPackCodec();
  const std::string topic("test.raw", 9);  // with its terminating NUL
  const auto send = [&](const std::string& inBytes) {
    publisher.send(zmq::buffer(topic), zmq::send_flags::sndmore);
    publisher.send(zmq::buffer(inBytes), zmq::send_flags::none);
  };
  const auto encode = [&](const WireType& inType, std::uint64_t inSequence) {
    std::string bytes;
    codec->Encode({77, inSequence}, inType, MakeTick(inSequence, 1), bytes);
    return bytes;
  };
  const WireType& tick = Tarn::Remote::WireTypeOf<Tick>();
  WireType unknown = tick;
  unknown.mWireName = "test.nobody";
  WireType newer = tick;
  newer.mVersion = 2;
  WireType mistyped = tick;
  mistyped.mWrite = [](const Tarn::Message&, Tarn::Remote::FieldWriter& ioWriter) {
    ioWriter.Begin(1);
    ioWriter.Text("mNumber", "four");
  };
  send(encode(tick, 1));
  send(encode(unknown, 2));
  send(encode(newer, 3));
  send(encode(mistyped, 4));
  send(std::string("\xc1\xc1", 2));                               // not MessagePack at all
  publisher.send(zmq::buffer(topic), zmq::send_flags::none);      // a topic without a body
  send(encode(tick, 7));                                          // 5 and 6 lost
  send(encode(tick, 7));                                          // again
  send(encode(tick, 6));                                          // late
  send(encode(tick, 0));                                          // no sequence
  send(encode(tick, 8));
  return 0;
}

}  // namespace

int main(int inArgc, char** inArgv) {
  const std::string mode = inArgc > 1 ? inArgv[1] : "";
  Tarn::Messaging::Initialize();
  for (const char* station : {"test.remote", "test.twoway"}) {
    Tarn::StationRegistry::RegisterStation(ImmutableString::CreateStatic(station), nullptr);
  }
  int status = 1;
  if (mode == "burst" && inArgc == 5) {
    status = Burst(inArgv[2], std::strtoull(inArgv[3], nullptr, 10), std::strtoull(inArgv[4], nullptr, 10));
  } else if (mode == "twoway" && inArgc == 5) {
    status = TwoWay(inArgv[2], inArgv[3], std::strtoull(inArgv[4], nullptr, 10));
  } else if ((mode == "serve" || mode == "hang") && inArgc == 4) {
    status = Serve(inArgv[2], std::atoi(inArgv[3]), mode == "hang");
  } else if (mode == "state" && inArgc == 3) {
    status = State(inArgv[2]);
  } else if (mode == "import" && (inArgc == 4 || inArgc == 7)) {
    status = Import(inArgv + 2, inArgc == 7);
  } else if (mode == "raw" && inArgc == 3) {
    status = Raw(inArgv[2]);
  }
  Tarn::Messaging::Terminate();
  return status;
}
