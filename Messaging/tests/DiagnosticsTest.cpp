// Faults made visible: message types whose IDs collide, stations relaying in
// a cycle, the registry's snapshot, and the reports of calls that otherwise
// fail in silence.
#include "DiagnosticsTestSupport.h"
#include "StationTestSupport.h"

#include <typeinfo>

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
  EXPECT_EQ(dialog.Count(), 0u);
  const CollisionYa second;
  ASSERT_EQ(dialog.Count(), 1u);
  const std::string condition = dialog.Entries()[0].condition;
  EXPECT_NE(condition.find("diagnostics_test::CollisionXf (N16diagnostics_test11CollisionXfE) and "
                           "diagnostics_test::CollisionYa"), std::string::npos) << condition;
  ASSERT_EQ(errors.Count(), 1u);
  const kivcore::config::ErrorReport report = errors.Entries()[0];
  EXPECT_TRUE(report.level == 0 && report.number == 105u && report.code == 25 && report.flag)
      << "not the report a failed contract check makes";
  EXPECT_EQ(second.As<CollisionXf>(), nullptr);
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
  EXPECT_TRUE(thirdID != first && thirdID != second.GetMessageID());
  EXPECT_EQ(dialog.Count(), 2u);
}

// A ring of 1 to 3 stations relaying (one station: attached to itself), a
// plain listener on each, and the contract report returning or throwing. The
// first station also has a listener that broadcasts one new message on it,
// which is no cycle.
class RelayCycle : public RegistryTest, public ::testing::WithParamInterface<std::tuple<int, bool>> {};

TEST_P(RelayCycle, IsReportedAndEachListenerHearsEachMessageOnce) {
  const int stationCount = std::get<0>(GetParam());
  const bool reportThrows = std::get<1>(GetParam());
  messaging_test::ContractDialogRecorder dialog;
  messaging_test::ExceptionRecorder exceptions;
  std::optional<messaging_test::ErrorRecorder> returning;
  std::optional<messaging_test::DefaultErrorHandlerGuard> throwing;
  if (reportThrows) throwing.emplace();
  else returning.emplace();
  std::vector<std::unique_ptr<Tarn::Station>> stations;
  std::vector<std::unique_ptr<RecordingListener>> listeners;
  for (int i = 0; i < stationCount; ++i) {
    stations.push_back(std::make_unique<Tarn::Station>(Registry::UniqueStationID()));
    listeners.push_back(std::make_unique<RecordingListener>("plain"));
    stations.back()->AddListener(listeners.back().get());
    if (i > 0) stations[i - 1]->AddListener(stations[i].get());
  }
  stations.back()->AddListener(stations[0].get());
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
  EXPECT_EQ(dialog.Entries()[0].function, "Tarn::Station::ListenToMessage");
  EXPECT_EQ(exceptions.Count(), reportThrows ? 2u : 0u);
}

INSTANTIATE_TEST_SUITE_P(Rings, RelayCycle,
                         ::testing::Combine(::testing::Values(1, 2, 3), ::testing::Bool()));

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

  // State, retains and listeners of a station, or "none".
  const auto seen = [](const Registry::StationSnapshotList& inSnapshot, const ImmutableString& inID) {
    for (const Registry::StationSnapshot& station : inSnapshot)
      if (station.mStationID == inID)
        return Registry::ToString(station.mState) + std::string("/") + std::to_string(station.mRetainCount) + "/" +
               std::to_string(station.mListenerCount);
    return std::string("none");
  };
  EXPECT_EQ(seen(Registry::Snapshot(), unmade), "not made/0/0");
  EXPECT_EQ(seen(Registry::Snapshot(), kept), "made/1/2");
  Registry::DisposeStation(kept);
  EXPECT_EQ(seen(Registry::Snapshot(), kept), "pending disposal/1/2");
  // Taken inside a broadcast on a station just disposed of: it waits, listed.
  Registry::FindStation(busy)->BroadcastMessage(messaging_test::PingMessage());
  EXPECT_EQ(seen(inside, busy), "pending deletion/0/1");
  EXPECT_STREQ(Registry::ToString(static_cast<Registry::StationState>(9)), "unknown");
  Utils::ReleaseStation(kept);
  const Registry::StationSnapshotList after = Registry::Snapshot();
  EXPECT_EQ(seen(after, kept) + seen(after, busy), "nonenone");
  EXPECT_EQ(station_test::StationLog::Destructions(), 1);
}

// Whether report inAt is a silent-failure report of inKind whose text holds inText.
bool HasKey(const std::vector<kivcore::config::ErrorReport>& inReports, std::size_t inAt, const std::string& inKind,
            const std::string& inText) {
  const std::string key = inAt < inReports.size() ? inReports[inAt].key : "";
  return key.rfind(Tarn::Diagnostics::kSilentFailureKeyPrefix + inKind + "=", 0) == 0 && key.find(inText) != key.npos;
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
  EXPECT_TRUE(HasKey(errors.Entries(), 0, "BeforeInitialize", "Tarn::Messaging::Initialize first"));

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
  EXPECT_TRUE(HasKey(errors.Entries(), 1, "BroadcastOffMainThread", "Tarn::StationUtils::BroadcastMessage"));
  EXPECT_TRUE(HasKey(errors.Entries(), 2, "BroadcastOffMainThread", "Tarn::Station::BroadcastMessage"));
  EXPECT_TRUE(HasKey(errors.Entries(), 3, "BroadcastOffMainThread", "Tarn::Broadcaster::BroadcastMessage"));

  const ImmutableString nowhere = Registry::UniqueStationID();
  for (int i = 0; i < 2; ++i) RemoveFromOneSite(nowhere, &listener);
  Utils::SwitchStation(nowhere, station, &listener);
  EXPECT_TRUE(HasKey(errors.Entries(), 4, "UnregisteredStation", nowhere.c_str()));
  EXPECT_TRUE(HasKey(errors.Entries(), 5, "UnregisteredStation", "Tarn::StationUtils::RemoveListener"));
  Utils::RetainStation(nowhere);
  EXPECT_TRUE(HasKey(errors.Entries(), 6, "UnregisteredStation", "Tarn::StationUtils::RetainStation"));
  EXPECT_EQ(errors.Count(), 7u);
  {
    // A throwing handler changes nothing either.
    const messaging_test::DefaultErrorHandlerGuard throwing;
    EXPECT_NO_THROW(Utils::StartBroadcasting(nowhere));
  }
  const messaging_test::SilentFailureReportsSetting off(SilentFailureReports::kOff);
  Utils::StopBroadcasting(nowhere);
  EXPECT_EQ(errors.Count(), 7u);
  Tarn::Diagnostics::SetSilentFailureReports(SilentFailureReports::kOn);

  // A worker's Initialize only counts; the main thread stays where it was.
  station_test::RunOnWorker([] { Tarn::Messaging::Initialize(); });
  EXPECT_TRUE(HasKey(errors.Entries(), 7, "InitializeOffMainThread", "only counted (2 now)"));
  Tarn::Messaging::Terminate();
  Utils::BroadcastMessage(station, messaging_test::PingMessage());
  EXPECT_EQ(listener.Calls(), 1);

  // A posted "quit" ends the library: the delivery's own hold on the station
  // is not the host's to balance, nor is a station made and let go.
  EXPECT_FALSE(Utils::HasListeners(Tarn::kStation_Repeat));
  Utils::RetainStation(station);
  listener.SetAction([](const Tarn::Message&) { Tarn::Messaging::Terminate(); });
  Utils::PostMessageToUIThread(station, messaging_test::PingMessage(), true);
  Utils::FlushPostedMessagesOnUIThread();
  EXPECT_TRUE(HasKey(errors.Entries(), 8, "RetainedAtTerminate",
                     "1 station(s) still retained, the first \"" + std::string(station.c_str()) + "\" 1 time(s)"));
  EXPECT_TRUE(HasKey(errors.Entries(), 9, "ListenersAtTerminate", "1 station(s) with listeners still attached"));
  EXPECT_EQ(errors.Count(), 10u);
}

// The calls a new user makes most, by an ID that names no station: each says
// so once, and a post's copy still goes its documented way (dropped when it
// finds no station; not reported again then, that miss is the library's own).
TEST(SilentFailures, SubscriptionsAndEveryKindOfPostOnAnUnregisteredIDAreReported) {
  using messaging_test::PingMessage;
  const messaging_test::SilentFailureReportsSetting on(SilentFailureReports::kOn);
  messaging_test::ErrorRecorder errors;
  RecordingListener listener("listener");
  Tarn::Registration registration = Tarn::Subscribe<PingMessage>(Tarn::kStation_StatusBar, [](const PingMessage&) {});
  EXPECT_TRUE(HasKey(errors.Entries(), 0, "BeforeInitialize", "Tarn::Subscribe on station \"tarn.app.status.bar\""));
  Tarn::Messaging::Initialize();
  const ImmutableString nowhere = Registry::UniqueStationID();
  const Tarn::PostCancelToken token;
  const std::pair<const char*, std::function<void()>> calls[] = {
      {"Tarn::Subscribe", [&] { registration = Tarn::Subscribe<PingMessage>(nowhere, [](const PingMessage&) {}); }},
      {"Tarn::Attach", [&] { registration = Tarn::Attach(nowhere, &listener); }},
      {"Tarn::StationUtils::PostMessageToUIThread", [&] { Utils::PostMessageToUIThread(nowhere, PingMessage(), false); }},
      {"Tarn::StationUtils::PostMessageToUIThread", [&] { Utils::PostMessageToUIThread(nowhere, PingMessage(), true); }},
      {"Tarn::StationUtils::PostMessageToUIThread", [&] { Utils::PostMessageToUIThread(nowhere, PingMessage(), token); }},
      {"Tarn::StationUtils::PostCoalescedMessageToUIThread", [&] { Utils::PostCoalescedMessageToUIThread(nowhere, PingMessage()); }},
      {"Tarn::StationUtils::PostCoalescedMessageToUIThread", [&] { Utils::PostCoalescedMessageToUIThread(nowhere, PingMessage(), 7); }},
      {"Tarn::StationUtils::PostMessageAtIdleTime", [&] { Utils::PostMessageAtIdleTime(nowhere, PingMessage()); }}};
  for (std::size_t i = 0; i < std::size(calls); ++i) {
    calls[i].second();
    EXPECT_TRUE(HasKey(errors.Entries(), i + 1, "UnregisteredStation", calls[i].first)) << i;
  }
  EXPECT_FALSE(registration);
  Utils::FlushPostedMessagesOnUIThread();
  Utils::BroadcastMessage(Tarn::kStation_Idle, Tarn::ApplicationIdleMessage());
  EXPECT_EQ(errors.Count(), std::size(calls) + 1);
  EXPECT_EQ(listener.Calls(), 0);
  Tarn::Messaging::Terminate();
}

}  // namespace
