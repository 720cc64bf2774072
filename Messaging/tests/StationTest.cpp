// Tarn::Station as a relay (what it hears as a listener it broadcasts again),
// its destruction through any of its bases, the registry lookup its
// destructor makes, and the well-known station IDs.
#include "StationTestSupport.h"

#include <memory>
#include <set>
#include <typeinfo>

namespace {

using namespace station_test;
namespace Registry = Tarn::StationRegistry;
using messaging_test::CallLog;
using messaging_test::RecordingListener;

class StationTest : public RegistryTest {};

Tarn::Listener* AsListener(Tarn::Station& inStation) { return &inStation; }

// ---------------------------------------------------------------------------
// Relaying

TEST_F(StationTest, ListenToMessageReachesEveryListenerWithTheSameMessageObject) {
  Tarn::Station station(Registry::UniqueStationID());
  MessageRecorder first;
  MessageRecorder second;
  station.AddListener(&first);
  station.AddListener(&second);

  const NumberMessage message(7);
  station.ListenToMessage(message);
  EXPECT_EQ(first.Addresses(), std::vector<const Tarn::Message*>{&message});
  EXPECT_EQ(second.Addresses(), std::vector<const Tarn::Message*>{&message});

  // Exactly as a direct broadcast does.
  station.BroadcastMessage(message);
  EXPECT_EQ(first.Values(), (std::vector<int>{7, 7}));
  EXPECT_EQ(second.Addresses(), (std::vector<const Tarn::Message*>{&message, &message}));
}

TEST_F(StationTest, StationAttachedToABroadcasterRelaysItsBroadcasts) {
  Tarn::Broadcaster source;
  Tarn::Station station(Registry::UniqueStationID());
  MessageRecorder listener;
  station.AddListener(&listener);
  source.AddListener(AsListener(station));

  const NumberMessage message(3);
  source.BroadcastMessage(message);
  EXPECT_EQ(listener.Addresses(), std::vector<const Tarn::Message*>{&message});
  source.RemoveListener(AsListener(station), true);
}

TEST_F(StationTest, ChainOfStationsRelaysAlongTheWholeChain) {
  Tarn::Station first(Registry::UniqueStationID());
  Tarn::Station second(Registry::UniqueStationID());
  Tarn::Station third(Registry::UniqueStationID());
  CallLog log;
  RecordingListener atFirst("first", &log);
  RecordingListener atSecond("second", &log);
  RecordingListener atThird("third", &log);
  first.AddListener(&atFirst);
  second.AddListener(&atSecond);
  third.AddListener(&atThird);
  // Added after the recorders, so served first: a relay runs the whole
  // downstream chain before the station's own recorder.
  first.AddListener(AsListener(second));
  second.AddListener(AsListener(third));

  first.BroadcastMessage(NumberMessage(5));
  EXPECT_EQ(log.Entries(), (std::vector<std::string>{"third:5", "second:5", "first:5"}));
}

TEST_F(StationTest, StoppedStationInAChainDropsWhatItHears) {
  Tarn::Station first(Registry::UniqueStationID());
  Tarn::Station second(Registry::UniqueStationID());
  Tarn::Station third(Registry::UniqueStationID());
  RecordingListener atSecond("second");
  RecordingListener atThird("third");
  second.AddListener(&atSecond);
  third.AddListener(&atThird);
  first.AddListener(AsListener(second));
  second.AddListener(AsListener(third));

  second.StopBroadcasting();
  first.BroadcastMessage(NumberMessage(1));
  EXPECT_EQ(atSecond.Calls(), 0);
  EXPECT_EQ(atThird.Calls(), 0);

  second.StartBroadcasting();
  first.BroadcastMessage(NumberMessage(2));
  EXPECT_EQ(atSecond.Calls(), 1);
  EXPECT_EQ(atThird.Calls(), 1);
}

TEST_F(StationTest, StationRelaysNothingOffTheMainThread) {
  Tarn::Station station(Registry::UniqueStationID());
  RecordingListener listener("listener");
  station.AddListener(&listener);
  RunOnWorker([&] {
    station.ListenToMessage(NumberMessage(1));
    station.BroadcastMessage(NumberMessage(2));
  });
  EXPECT_EQ(listener.Calls(), 0);
}

// A derived station that counts the broadcasts that reach its override.
class CountingOverrideStation : public Tarn::Station {
public:
  using Tarn::Station::Station;
  void BroadcastMessage(const Tarn::Message& inMessage) override {
    ++mOverrideCalls;
    Tarn::Station::BroadcastMessage(inMessage);
  }
  int mOverrideCalls = 0;
};

TEST_F(StationTest, RelayedMessagesBypassAnOverriddenBroadcastMessage) {
  CountingOverrideStation station(Registry::UniqueStationID());
  RecordingListener listener("listener");
  station.AddListener(&listener);

  station.ListenToMessage(NumberMessage(1));
  EXPECT_EQ(station.mOverrideCalls, 0);
  EXPECT_EQ(listener.Calls(), 1);

  static_cast<Tarn::Broadcaster&>(station).BroadcastMessage(NumberMessage(2));
  EXPECT_EQ(station.mOverrideCalls, 1);
  EXPECT_EQ(listener.Calls(), 2);
}

// ---------------------------------------------------------------------------
// Identity and layout

TEST_F(StationTest, StationKeepsTheIdItWasGivenEvenTheEmptyOne) {
  const ImmutableString id = ImmutableString::CreateDynamic("station.test.name");
  Tarn::Station named(id);
  EXPECT_EQ(named.GetStationID(), id);
  EXPECT_STREQ(named.GetStationID().c_str(), "station.test.name");

  Tarn::Station unnamed(Tarn::kNoStation);
  EXPECT_TRUE(unnamed.GetStationID().empty());
  RecordingListener listener("listener");
  unnamed.AddListener(&listener);
  unnamed.BroadcastMessage(NumberMessage(1));
  EXPECT_EQ(listener.Calls(), 1);
}

TEST_F(StationTest, StationAndItsBroadcasterPartShareTheirAddress) {
  Tarn::Station station(Registry::UniqueStationID());
  EXPECT_EQ(static_cast<void*>(static_cast<Tarn::Broadcaster*>(&station)), static_cast<void*>(&station));
}

// ---------------------------------------------------------------------------
// Destruction

TEST_F(StationTest, DeletingThroughAnyBasePointerRunsTheWholeDestructor) {
  Tarn::Station* byStation = new CountedStation(Registry::UniqueStationID());
  Tarn::Station* byBroadcaster = new CountedStation(Registry::UniqueStationID());
  Tarn::Station* byListener = new CountedStation(Registry::UniqueStationID());

  delete byStation;
  EXPECT_EQ(StationLog::DestroyedSerials(), std::vector<int>{1});
  delete static_cast<Tarn::Broadcaster*>(byBroadcaster);
  EXPECT_EQ(StationLog::DestroyedSerials(), (std::vector<int>{1, 2}));
  delete static_cast<Tarn::Listener*>(byListener);
  EXPECT_EQ(StationLog::DestroyedSerials(), (std::vector<int>{1, 2, 3}));
}

TEST_F(StationTest, DeletingAStationDetachesItFromItsListenersAndFromWhatItListenedTo) {
  Tarn::Broadcaster upstream;
  Tarn::Station upstreamStation(Registry::UniqueStationID());
  auto* station = new CountedStation(Registry::UniqueStationID());
  Tarn::Broadcaster* const stationAsBroadcaster = station;
  Tarn::Listener* const stationAsListener = station;
  upstream.AddListener(stationAsListener);
  upstreamStation.AddListener(stationAsListener);
  RecordingListener plain("plain");
  auto weak = std::make_shared<RecordingListener>("weak");
  station->AddListener(&plain);
  station->AddListener(std::weak_ptr<Tarn::Listener>(weak));
  ASSERT_TRUE(plain.HasBroadcaster(stationAsBroadcaster));
  ASSERT_TRUE(stationAsListener->HasBroadcaster(&upstream));

  delete station;
  EXPECT_FALSE(plain.HasBroadcaster(stationAsBroadcaster));
  EXPECT_FALSE(upstream.HasListener(stationAsListener));
  EXPECT_FALSE(upstream.HasListeners());
  EXPECT_FALSE(upstreamStation.HasListeners());

  // The former upstream broadcasts safely; the former listeners hear nothing
  // and were neither deleted nor told.
  upstream.BroadcastMessage(NumberMessage(1));
  upstreamStation.BroadcastMessage(NumberMessage(2));
  EXPECT_EQ(plain.Calls(), 0);
  EXPECT_EQ(weak->Calls(), 0);
  EXPECT_EQ(weak.use_count(), 1);
}

TEST_F(StationTest, DestroyingAStationWithAnUnregisteredIdCreatesNothing) {
  const ImmutableString id = Registry::UniqueStationID();
  { CountedStation station(id); }
  EXPECT_EQ(Registry::FindStation(id), nullptr);
  EXPECT_EQ(StationLog::Factories(), 0);
}

TEST_F(StationTest, DestroyingAStationWhoseIdIsRegisteredButNotMadeMakesTheRegisteredStation) {
  const ImmutableString id = RegisterCounted();
  { Tarn::Station own(id); }
  EXPECT_EQ(StationLog::Factories(), 1);
  EXPECT_NE(Counted(id), nullptr);
}

TEST_F(StationTest, StationDeletedByTheRegistryLooksItselfUpAndFindsNothing) {
  const ImmutableString id = MakeCounted();
  Registry::DisposeStation(id);
  EXPECT_EQ(StationLog::Destructions(), 1);
  EXPECT_EQ(StationLog::Factories(), 1) << "the destructor's lookup made a new station";
}

// ---------------------------------------------------------------------------
// Well-known station IDs

TEST_F(StationTest, WellKnownStationIdsHaveTheirTexts) {
  EXPECT_STREQ(Tarn::kNoStation.c_str(), "");
  EXPECT_TRUE(Tarn::kNoStation.empty());
  EXPECT_STREQ(Tarn::kStation_Idle.c_str(), "tarn.idle");
  EXPECT_STREQ(Tarn::kStation_Repeat.c_str(), "tarn.repeat");
  EXPECT_STREQ(Tarn::kStation_AppSuspend.c_str(), "tarn.app.suspend");
  EXPECT_STREQ(Tarn::kStation_AppResume.c_str(), "tarn.app.resume");
  EXPECT_STREQ(Tarn::kStation_AboutDialog.c_str(), "tarn.aboutdialog");
  EXPECT_STREQ(Tarn::kStation_DirectoryChange.c_str(), "tarn.directorychange");
  EXPECT_STREQ(Tarn::kStation_PanicSave.c_str(), "tarn.app.panic.save");
  EXPECT_STREQ(Tarn::kStation_StatusBar.c_str(), "tarn.app.status.bar");
  EXPECT_STREQ(Tarn::kStation_ColorPicker.c_str(), "tarn.app.color.picker");
  EXPECT_STREQ(Tarn::kStation_LocateClip.c_str(), "tarn.app.locate.clip");
}

TEST_F(StationTest, WellKnownStationIdsAreDistinctAndEqualToAnyStringOfTheSameText) {
  const std::vector<const ImmutableString*> ids = {
      &Tarn::kStation_Idle,       &Tarn::kStation_Repeat,          &Tarn::kStation_AppSuspend,
      &Tarn::kStation_AppResume,  &Tarn::kStation_AboutDialog,     &Tarn::kStation_DirectoryChange,
      &Tarn::kStation_PanicSave,  &Tarn::kStation_StatusBar,       &Tarn::kStation_ColorPicker,
      &Tarn::kStation_LocateClip};
  std::set<std::string> texts;
  for (const ImmutableString* id : ids) {
    EXPECT_FALSE(id->empty());
    EXPECT_NE(*id, Tarn::kNoStation);
    texts.insert(id->c_str());
    // Station IDs compare by identity; a string made elsewhere from the same
    // text must name the same station.
    EXPECT_EQ(ImmutableString::CreateDynamic(id->c_str()), *id) << id->c_str();
  }
  EXPECT_EQ(texts.size(), ids.size());
}

TEST_F(StationTest, NoStationNamesNoStationUnlessACallerRegistersIt) {
  EXPECT_EQ(Registry::FindStation(Tarn::kNoStation), nullptr);
  EXPECT_EQ(Registry::RetainStation(Tarn::kNoStation), nullptr);

  Registry::RegisterStation(Tarn::kNoStation, &CountingFactory);
  Tarn::Station* station = Registry::FindStation(Tarn::kNoStation);
  ASSERT_NE(station, nullptr);
  EXPECT_TRUE(station->GetStationID().empty());
}

}  // namespace
