// Stations as relays, and when the registry deletes them: never while a
// broadcast on them runs, never twice, none lost.
#include "StationTestSupport.h"

#include <regex>

namespace {

using namespace station_test;
namespace Registry = Tarn::StationRegistry;
using namespace messaging_test;

class StationTest : public RegistryTest {};

// The relay's disposal is pending (queued by a worker, or retained and
// released from inside its own relay): a handler reached through the relay
// that deletes stations on the main thread once freed the relay under its
// own broadcast. Now it goes when that broadcast ends.
TEST_F(StationTest, RelayDisposedOrReleasedFromInsideItsOwnBroadcastIsDeletedWhenTheBroadcastEnds) {
  for (const bool byRelease : {false, true}) {
    SCOPED_TRACE(byRelease ? "last release inside the relay" : "worker disposal, then a main-thread disposal");
    StationLog::Reset();
    CallLog log;
    Tarn::Station source(Registry::UniqueStationID());
    const ImmutableString relayID = MakeCounted();
    Tarn::Station* relay = Counted(relayID);
    source.AddListener(relay);
    RecordingListener last("last", &log), first("first", &log);
    first.SetAction([&](const Tarn::Message&) {
      byRelease ? Registry::ReleaseStation(relayID) : DrainPendingStations();
      EXPECT_EQ(StationLog::Destructions(), 0) << "the relay was deleted under its own broadcast";
    });
    last.SetAction([&](const Tarn::Message&) { EXPECT_EQ(StationLog::Destructions(), 0); });
    relay->AddListener(&last);
    relay->AddListener(&first);
    ASSERT_TRUE(!byRelease || Registry::RetainStation(relayID) == relay);
    byRelease ? Registry::DisposeStation(relayID) : RunOnWorker([&] { Registry::DisposeStation(relayID); });
    source.BroadcastMessage(NumberMessage(7));
    EXPECT_EQ(log.Entries(), (std::vector<std::string>{"first:7", "last:7"}));
    EXPECT_EQ(StationLog::Destructions(), 1) << "the relay outlived its broadcast";
    EXPECT_FALSE(source.HasListeners());
    EXPECT_FALSE(first.HasBroadcaster(relay));
  }
}

// A host's unbalanced release and a disposal, from a handler of a broadcast
// made by ID: the broadcast's own hold keeps the record until it ends (its
// release reaches the record by address), and that release completes the
// disposal instead of wrapping the count.
TEST_F(StationTest, AnUnbalancedReleaseUnderABroadcastByIDNeitherFreesNorKeepsTheStation) {
  StationLog::Reset();
  const ImmutableString id = MakeCounted();
  RecordingListener listener("L");
  listener.SetAction([&](const Tarn::Message&) {
    Registry::ReleaseStation(id);
    Registry::DisposeStation(id);
    EXPECT_NE(Registry::FindStation(id), nullptr) << "the record went while the broadcast held it";
  });
  Tarn::StationUtils::AddListener(id, &listener);
  Tarn::StationUtils::BroadcastMessage(id, NumberMessage(1));
  EXPECT_EQ(listener.Calls(), 1);
  EXPECT_EQ(StationLog::Destructions(), 1) << "the disposal was left pending for ever";
  EXPECT_EQ(Registry::FindStation(id), nullptr);
}

// A retain whose factory throws or gives no station is not counted, so a
// later disposal deletes the record at once instead of waiting for ever.
TEST_F(StationTest, ARetainThatMakesNoStationLeavesNoCountBehind) {
  static int sCalls = 0;
  const ImmutableString id = Registry::UniqueStationID();
  EXPECT_TRUE(std::regex_match(id.c_str(), std::regex("\\{[0-9a-f]{8}(-[0-9a-f]{4}){3}-[0-9a-f]{12}\\}"))) << id.c_str();
  Registry::RegisterStation(id, [](const ImmutableString& inID) -> Tarn::Station* {
    if (++sCalls == 1) throw std::runtime_error("factory");
    return sCalls == 2 ? nullptr : new CountedStation(inID);
  });
  EXPECT_THROW(Registry::RetainStation(id), std::runtime_error);
  EXPECT_EQ(Registry::RetainStation(id), nullptr);
  ASSERT_NE(Registry::FindStation(id), nullptr);
  Registry::DisposeStation(id);
  EXPECT_EQ(StationLog::Destructions(), 1) << "a failed retain kept the station's count up";
  EXPECT_EQ(Registry::FindStation(id), nullptr);
  Registry::RegisterStation(static_cast<Tarn::Station*>(nullptr));  // nothing to register
  Registry::ReleaseStation(id);  // no longer registered: nothing to release, nothing read
}

// A station a worker's disposal queued, whose ID is then registered anew with
// a factory that throws: deleting it looks its ID up, which runs the factory
// inside the destructor. The process once ended there; now the failure goes
// to the error manager and the deletion completes.
TEST_F(StationTest, AStationWhoseIDWasRegisteredAnewWithAFailingFactoryIsDeletedAndTheFailureReported) {
  messaging_test::ExceptionRecorder failures;
  const ImmutableString id = MakeCounted();
  RunOnWorker([&] { Registry::DisposeStation(id); });
  Registry::RegisterStation(id, [](const ImmutableString&) -> Tarn::Station* { throw std::runtime_error("factory"); });
  DrainPendingStations();
  EXPECT_EQ(StationLog::Destructions(), 1);
  EXPECT_EQ(failures.Entries(), std::vector<std::string>{"factory"});
}

// A station a worker disposed of waits for a main-thread disposal; the last
// Terminate once left it alive, with its listeners, into the next life.
TEST_F(StationTest, AStationAWorkerDisposedOfGoesWithTheLastTerminate) {
  Tarn::Messaging::Initialize();
  const ImmutableString id = MakeCounted();
  RunOnWorker([&] { Registry::DisposeStation(id); });
  EXPECT_EQ(StationLog::Destructions(), 0);
  Tarn::Messaging::Terminate();
  EXPECT_EQ(StationLog::Destructions(), 1) << "a station a worker disposed of outlived the last Terminate";
}

}  // namespace
