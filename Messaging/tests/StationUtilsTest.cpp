// Tarn::StationUtils: working on a station by its ID. Every function brackets
// its work with a retain and a release and does nothing for an ID that is
// not registered. (Misuse is covered with every other check site.)
#include "StationTestSupport.h"

#include <boost/make_shared.hpp>

namespace {

using namespace station_test;
namespace Registry = Tarn::StationRegistry;
namespace Utils = Tarn::StationUtils;
using namespace messaging_test;

class StationUtilsTest : public RegistryTest {};

// Whether the station is unretained: a main-thread disposal deletes it at once.
bool DisposedAtOnce(const ImmutableString& inStationID) {
  const int before = StationLog::Destructions();
  Registry::DisposeStation(inStationID);
  return StationLog::Destructions() == before + 1;
}

TEST_F(StationUtilsTest, EachKindIsAttachedByIDAndDetachedAgainWhileEveryRetainIsReleased) {
  RecordingListener plain("plain");
  const auto boostOwner = boost::make_shared<RecordingListener>("boost");
  const auto stdOwner = std::make_shared<RecordingListener>("std");
  auto* const safe = new messaging_test::CountedSafeListener("safe");
  const Tarn::ISafeListenerRef safeRef(safe);
  const boost::weak_ptr<Tarn::Listener> boostWeak(boostOwner);  // the registrations hold weak pointers only
  const std::weak_ptr<Tarn::Listener> stdWeak(stdOwner);
  const std::function<void(const ImmutableString&, bool)> kinds[] = {
      [&](auto& inID, bool inAdd) { inAdd ? Utils::AddListener(inID, &plain) : Utils::RemoveListener(inID, &plain); },
      [&](auto& inID, bool inAdd) { inAdd ? Utils::AddListener(inID, boostWeak) : Utils::RemoveListener(inID, boostWeak); },
      [&](auto& inID, bool inAdd) { inAdd ? Utils::AddListener(inID, stdWeak) : Utils::RemoveListener(inID, stdWeak); },
      [&](auto& inID, bool inAdd) { inAdd ? Utils::AddListener(inID, safeRef) : Utils::RemoveListener(inID, safeRef); }};
  const std::int32_t safeReferences = safe->RefCount();
  const ImmutableString unregistered = Registry::UniqueStationID();
  for (const auto& kind : kinds) {
    const ImmutableString id = RegisterCounted();
    const int calls = plain.Calls() + boostOwner->Calls() + stdOwner->Calls() + safe->Calls();
    for (const ImmutableString& target : {unregistered, id}) {
      kind(target, true);
      Utils::BroadcastMessage(target, NumberMessage(1));
      RunOnWorker([&] { Utils::BroadcastMessage(target, NumberMessage(2)); });  // off the main thread: nothing
    }
    EXPECT_EQ(plain.Calls() + boostOwner->Calls() + stdOwner->Calls() + safe->Calls(), calls + 1);
    EXPECT_EQ(safe->RefCount(), safeReferences) << "a station holds a counted reference";
    kind(unregistered, false);
    kind(id, false);
    EXPECT_FALSE(Utils::HasListeners(id));
    EXPECT_EQ(Registry::FindStation(unregistered), nullptr);
    EXPECT_TRUE(DisposedAtOnce(id)) << "a retain was not released";
  }
}

TEST_F(StationUtilsTest, SwitchStationMovesTheListenerToTheNewestPlaceOfItsDestination) {
  const ImmutableString from = MakeCounted(), to = MakeCounted(), unregistered = Registry::UniqueStationID();
  messaging_test::CallLog log;
  RecordingListener mover("mover", &log), resident("resident", &log);
  Utils::AddListener(to, &resident);
  Utils::SwitchStation(unregistered, from, &mover);  // from nowhere: simply added
  Utils::SwitchStation(from, to, &mover);
  Utils::BroadcastMessage(from, NumberMessage(1));
  Utils::BroadcastMessage(to, NumberMessage(2));
  EXPECT_FALSE(mover.HasBroadcaster(Registry::FindStation(from)));
  Utils::SwitchStation(to, to, &resident);  // re-added as the newest
  Utils::BroadcastMessage(to, NumberMessage(3));
  EXPECT_EQ(log.Entries(), (std::vector<std::string>{"mover:2", "resident:2", "resident:3", "mover:3"}));
  Utils::SwitchStation(to, unregistered, &mover);  // to nowhere: only removed
  EXPECT_FALSE(mover.HasBroadcaster(Registry::FindStation(to)));
  EXPECT_EQ(Registry::FindStation(unregistered), nullptr);
  EXPECT_TRUE(DisposedAtOnce(from));
  EXPECT_TRUE(DisposedAtOnce(to));
}

// A typed station is its ID under another name: what goes through the handle
// reaches listeners of the ID, and a worker's post through it is queued.
TEST_F(StationUtilsTest, ATypedStationDeliversThroughItsIDEveryWayItIsCalled) {
  const Tarn::TypedStation<NumberMessage, PingMessage> typed(RegisterCounted());
  std::vector<int> heard;
  Tarn::Registration numbers =
      Tarn::Subscribe<NumberMessage>(typed, [&](const NumberMessage& inMessage) { heard.push_back(inMessage.mValue); });
  Tarn::Registration pings = Tarn::Subscribe<PingMessage>(typed, [&](const PingMessage&) { heard.push_back(0); });
  Utils::BroadcastMessage(typed, NumberMessage(1));
  RunOnWorker([&] { Utils::PostMessageToUIThread(typed, NumberMessage(2), false); });
  Utils::PostCoalescedMessageToUIThread(typed, NumberMessage(3));
  Utils::PostMessageToUIThread(typed, PingMessage(), Tarn::PostCancelToken());
  Utils::FlushPostedMessagesOnUIThread();
  Utils::BroadcastMessage(typed.GetStationID(), NumberMessage(4));
  EXPECT_EQ(heard, (std::vector<int>{1, 2, 3, 0, 4}));
}

}  // namespace
