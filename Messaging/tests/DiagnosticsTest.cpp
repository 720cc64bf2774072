// Faults made visible: message types whose IDs collide, stations relaying in
// a cycle, the registry's snapshot, and the reports of calls that otherwise
// fail in silence.
#include "DiagnosticsTestSupport.h"
#include "StationTestSupport.h"

#include <TarnMessaging.h>

#include <gtest/gtest.h>

#include <memory>
#include <optional>
#include <string>
#include <typeinfo>
#include <vector>

namespace diagnostics_test {
// 'X' * 5 + 'f' == 'Y' * 5 + 'a', and the names are otherwise equal: the two
// decorated names hash to one ID.
struct CollisionXf : Tarn::MessageImpl<CollisionXf> {};
struct CollisionYa : Tarn::MessageImpl<CollisionYa> {
  long mPayload = 42;
};
}  // namespace diagnostics_test

namespace {

using diagnostics_test::CollisionXf;
using diagnostics_test::CollisionYa;
using kivcore::utility::ImmutableString;
using messaging_test::RecordingListener;
using station_test::RegistryTest;
using Tarn::Diagnostics::SilentFailureReports;
namespace Registry = Tarn::StationRegistry;
namespace Utils = Tarn::StationUtils;

TEST(MessageIDCollision, TheSecondTypeIsReportedNamingBothAndNeverTakenForTheFirst) {
  ASSERT_EQ(Tarn::HashMessageTypeNameToMessageID(typeid(CollisionXf).name()),
            Tarn::HashMessageTypeNameToMessageID(typeid(CollisionYa).name()));
  messaging_test::ContractDialogRecorder dialog;
  messaging_test::ErrorRecorder errors;
  const Tarn::MessageID first = CollisionXf::StaticMessageID();
  EXPECT_EQ(first, Tarn::HashMessageTypeNameToMessageID(typeid(CollisionXf).name()));
  EXPECT_EQ(dialog.Count(), 0u);
  const CollisionYa second;
  ASSERT_EQ(dialog.Count(), 1u);
  const std::string condition = dialog.Violations()[0].condition;
  EXPECT_NE(condition.find("diagnostics_test::CollisionXf"), std::string::npos) << condition;
  EXPECT_NE(condition.find("diagnostics_test::CollisionYa"), std::string::npos) << condition;
  EXPECT_EQ(errors.Count(), 1u);
  EXPECT_NE(second.GetMessageID(), first);
  EXPECT_EQ(second.As<CollisionXf>(), nullptr);
  EXPECT_EQ(second.As<CollisionYa>(), &second);
  // Another module finds the name's own ID, and the report is not repeated.
  EXPECT_EQ(Tarn::Detail::GlobalMessageID(typeid(CollisionYa).name()), second.GetMessageID());
  EXPECT_EQ(Tarn::Detail::GlobalMessageID(typeid(CollisionXf).name()), first);
  EXPECT_EQ(dialog.Count(), 1u);
  // A third name on the same hash, with the error handler throwing: the
  // report cannot leave the noexcept lookup, and the name gets an ID of its own.
  std::string third = typeid(CollisionXf).name();
  third.replace(third.find("Xf"), 2, "Z\\");
  const messaging_test::DefaultErrorHandlerGuard throwing;
  const Tarn::MessageID thirdID = Tarn::Detail::GlobalMessageID(third.c_str());
  EXPECT_NE(thirdID, first);
  EXPECT_NE(thirdID, second.GetMessageID());
  EXPECT_EQ(dialog.Count(), 2u);
}

// Stations relaying in a ring (or to themselves) with a plain listener on
// each; the first station also has a listener that broadcasts one new message
// on it, which is no cycle.
struct RelayCase {
  int mStations;
  bool mReportThrows;
};

class RelayCycle : public RegistryTest, public ::testing::WithParamInterface<RelayCase> {};

TEST_P(RelayCycle, IsReportedAndEachListenerHearsEachMessageOnce) {
  const RelayCase relay = GetParam();
  messaging_test::ContractDialogRecorder dialog;
  messaging_test::ExceptionRecorder exceptions;
  std::optional<messaging_test::ErrorRecorder> returning;
  std::optional<messaging_test::DefaultErrorHandlerGuard> throwing;
  if (relay.mReportThrows) throwing.emplace();
  else returning.emplace();
  std::vector<std::unique_ptr<Tarn::Station>> stations;
  std::vector<std::unique_ptr<RecordingListener>> listeners;
  for (int i = 0; i < relay.mStations; ++i) {
    stations.push_back(std::make_unique<Tarn::Station>(Registry::UniqueStationID()));
    listeners.push_back(std::make_unique<RecordingListener>("plain"));
    stations.back()->AddListener(listeners.back().get());
  }
  for (int i = 0; i < relay.mStations; ++i) stations[i]->AddListener(stations[(i + 1) % relay.mStations].get());
  RecordingListener again("again");
  again.SetAction([&](const Tarn::Message& inMessage) {
    if (inMessage.Is<messaging_test::PingMessage>()) stations[0]->BroadcastMessage(messaging_test::NumberMessage(1));
  });
  stations[0]->AddListener(&again);

  stations[0]->BroadcastMessage(messaging_test::PingMessage());
  for (const auto& listener : listeners) EXPECT_EQ(listener->Calls(), 2);
  EXPECT_EQ(again.Calls(), 2);
  // One report per message, each where the message came back.
  ASSERT_EQ(dialog.Count(), 2u);
  EXPECT_EQ(dialog.Violations()[0].function, "Tarn::Station::ListenToMessage");
  EXPECT_EQ(exceptions.Count(), relay.mReportThrows ? 2u : 0u);
}

INSTANTIATE_TEST_SUITE_P(Rings, RelayCycle,
                         ::testing::Values(RelayCase{1, false}, RelayCase{1, true}, RelayCase{2, false},
                                           RelayCase{2, true}, RelayCase{3, false}, RelayCase{3, true}));

const Registry::StationSnapshot* Find(const Registry::StationSnapshotList& inSnapshot, const ImmutableString& inID) {
  for (const Registry::StationSnapshot& station : inSnapshot)
    if (station.mStationID == inID) return &station;
  return nullptr;
}

TEST_F(RegistryTest, SnapshotShowsEveryStationsStateRetainsAndListeners) {
  const ImmutableString unmade = Registry::RegisterUniqueStation();
  const ImmutableString kept = Registry::RegisterUniqueStation();
  const ImmutableString busy = RegisterCounted();
  RecordingListener a("a"), b("b"), disposer("disposer");
  Utils::AddListener(kept, &a);
  Utils::AddListener(kept, &b);
  Utils::RetainStation(kept);
  Registry::StationSnapshotList inside;
  disposer.SetAction([&](const Tarn::Message&) {
    Registry::DisposeStation(busy);
    inside = Registry::Snapshot();
  });
  Utils::AddListener(busy, &disposer);

  Registry::StationSnapshotList snapshot = Registry::Snapshot();
  ASSERT_NE(Find(snapshot, unmade), nullptr);
  EXPECT_EQ(Find(snapshot, unmade)->mState, Registry::StationState::kNotMade);
  ASSERT_NE(Find(snapshot, kept), nullptr);
  EXPECT_EQ(Find(snapshot, kept)->mState, Registry::StationState::kMade);
  EXPECT_EQ(Find(snapshot, kept)->mRetainCount, 1u);
  EXPECT_EQ(Find(snapshot, kept)->mListenerCount, 2u);
  Registry::DisposeStation(kept);
  snapshot = Registry::Snapshot();
  EXPECT_EQ(Find(snapshot, kept)->mState, Registry::StationState::kPendingDisposal);
  // Taken inside a broadcast on a station just disposed of: it waits, listed.
  Tarn::Station* const station = Registry::FindStation(busy);
  station->BroadcastMessage(messaging_test::PingMessage());
  ASSERT_NE(Find(inside, busy), nullptr);
  EXPECT_EQ(Find(inside, busy)->mState, Registry::StationState::kPendingDeletion);
  EXPECT_EQ(Find(inside, busy)->mListenerCount, 1u);
  Utils::ReleaseStation(kept);
  snapshot = Registry::Snapshot();
  EXPECT_EQ(Find(snapshot, kept), nullptr);
  EXPECT_EQ(Find(snapshot, busy), nullptr);
  EXPECT_EQ(station_test::StationLog::Destructions(), 1);
}

bool HasKey(const std::vector<kivcore::config::ErrorReport>& inReports, std::size_t inAt, const std::string& inKind,
            const std::string& inText) {
  if (inAt >= inReports.size()) return false;
  const std::string& key = inReports[inAt].key;
  return key.rfind(std::string(Tarn::Diagnostics::kSilentFailureKeyPrefix) + inKind + "=", 0) == 0 &&
         key.find(inText) != std::string::npos;
}

// One call site however often it is reached: not inlined, and no tail call.
[[gnu::noinline]] void RemoveFromOneSite(const ImmutableString& inStationID, Tarn::Listener* inListener) {
  Utils::RemoveListener(inStationID, inListener);
  asm volatile("" ::: "memory");
}

[[gnu::noinline]] void BroadcastFromOneSite(const ImmutableString& inStationID) {
  Utils::BroadcastMessage(inStationID, messaging_test::PingMessage());
  asm volatile("" ::: "memory");
}

TEST(SilentFailures, AreReportedOncePerCallSiteAndChangeNothing) {
  const messaging_test::SilentFailureReportsSetting on(SilentFailureReports::kOn);
  messaging_test::ErrorRecorder errors;
  RecordingListener listener("listener");
  Utils::AddListener(Tarn::kStation_StatusBar, &listener);
  EXPECT_TRUE(HasKey(errors.Reports(), 0, "BeforeInitialize", "Tarn::Messaging::Initialize first"));

  Tarn::Messaging::Initialize();
  const ImmutableString station = Registry::RegisterUniqueStation();
  Utils::AddListener(station, &listener);
  Tarn::Broadcaster broadcaster;
  broadcaster.AddListener(&listener);
  station_test::RunOnWorker([&] {
    for (int i = 0; i < 2; ++i) BroadcastFromOneSite(station);
    Registry::FindStation(station)->BroadcastMessage(messaging_test::PingMessage());
    broadcaster.BroadcastMessage(messaging_test::PingMessage());
  });
  EXPECT_EQ(listener.Calls(), 0);
  EXPECT_TRUE(HasKey(errors.Reports(), 1, "BroadcastOffMainThread", "Tarn::StationUtils::BroadcastMessage"));
  EXPECT_TRUE(HasKey(errors.Reports(), 2, "BroadcastOffMainThread", "Tarn::Station::BroadcastMessage"));
  EXPECT_TRUE(HasKey(errors.Reports(), 3, "BroadcastOffMainThread", "Tarn::Broadcaster::BroadcastMessage"));

  const ImmutableString nowhere = Registry::UniqueStationID();
  for (int i = 0; i < 2; ++i) RemoveFromOneSite(nowhere, &listener);
  Utils::SwitchStation(nowhere, station, &listener);
  EXPECT_TRUE(HasKey(errors.Reports(), 4, "UnregisteredStation", nowhere.c_str()));
  EXPECT_TRUE(HasKey(errors.Reports(), 5, "UnregisteredStation", "Tarn::StationUtils::RemoveListener"));
  EXPECT_EQ(errors.Count(), 6u);
  // The library's own miss: a post that finds its station disposed of.
  Utils::PostMessageToUIThread(nowhere, messaging_test::PingMessage(), true);
  Utils::FlushPostedMessagesOnUIThread();
  EXPECT_EQ(errors.Count(), 6u);
  {
    // A throwing handler changes nothing either.
    const messaging_test::DefaultErrorHandlerGuard throwing;
    EXPECT_NO_THROW(Utils::StartBroadcasting(nowhere));
  }
  const messaging_test::SilentFailureReportsSetting off(SilentFailureReports::kOff);
  Utils::StopBroadcasting(nowhere);
  EXPECT_EQ(errors.Count(), 6u);
  Tarn::Diagnostics::SetSilentFailureReports(SilentFailureReports::kOn);

  Utils::RetainStation(station);
  Tarn::Messaging::Terminate();
  EXPECT_TRUE(HasKey(errors.Reports(), 6, "RetainedAtTerminate", station.c_str()));
  EXPECT_TRUE(HasKey(errors.Reports(), 7, "ListenersAtTerminate", "with 1"));
  EXPECT_EQ(errors.Count(), 8u);
}

}  // namespace
