// Tarn::StationUtils: working on a station by its ID. Every function brackets
// its work with a retain and a release and does nothing for an ID that is
// not registered. (Misuse is covered with every other check site.)
#include "StationTestSupport.h"

#include <boost/make_shared.hpp>

namespace {

using namespace station_test;
namespace Registry = Tarn::StationRegistry;
namespace Utils = Tarn::StationUtils;
using messaging_test::CallLog;
using messaging_test::CountedSafeListener;
using messaging_test::RecordingListener;

// One listener of each of the four kinds, attached and detached by ID.
struct FourListeners {
  RecordingListener mPlain{"plain"};
  boost::shared_ptr<RecordingListener> mBoost = boost::make_shared<RecordingListener>("boost");
  std::shared_ptr<RecordingListener> mStd = std::make_shared<RecordingListener>("std");
  CountedSafeListener* mSafe = new CountedSafeListener("safe");
  Tarn::ISafeListenerRef mSafeRef{mSafe};

  void Add(const ImmutableString& inID, int inKind) {
    if (inKind == 0) Utils::AddListener(inID, &mPlain);
    if (inKind == 1) Utils::AddListener(inID, boost::weak_ptr<Tarn::Listener>(mBoost));
    if (inKind == 2) Utils::AddListener(inID, std::weak_ptr<Tarn::Listener>(mStd));
    if (inKind == 3) Utils::AddListener(inID, mSafeRef);
  }
  void Remove(const ImmutableString& inID, int inKind) {
    if (inKind == 0) Utils::RemoveListener(inID, &mPlain);
    if (inKind == 1) Utils::RemoveListener(inID, boost::weak_ptr<Tarn::Listener>(mBoost));
    if (inKind == 2) Utils::RemoveListener(inID, std::weak_ptr<Tarn::Listener>(mStd));
    if (inKind == 3) Utils::RemoveListener(inID, mSafeRef);
  }
  int Calls() const { return mPlain.Calls() + mBoost->Calls() + mStd->Calls() + mSafe->Calls(); }
};

class StationUtilsTest : public RegistryTest {
protected:
  // Whether the station is unretained: a main-thread disposal deletes it at once.
  static bool DisposedAtOnce(const ImmutableString& inStationID) {
    const int before = StationLog::Destructions();
    Registry::DisposeStation(inStationID);
    return StationLog::Destructions() == before + 1;
  }
};

TEST_F(StationUtilsTest, EachKindIsAttachedByIDAndDetachedAgainWhileEveryRetainIsReleased) {
  messaging_test::ContractDialogRecorder dialog;
  FourListeners listeners;
  const std::int32_t safeReferences = listeners.mSafe->RefCount();
  const ImmutableString unregistered = Registry::UniqueStationID();
  const auto blocksBefore = kivcore::utility::SmallBlockAllocator::GetStatistics().blocksInUse;
  for (int kind = 0; kind < 4; ++kind) {
    // An ID that is not registered: silent no-ops that keep nothing.
    listeners.Add(unregistered, kind);
    Utils::BroadcastMessage(unregistered, NumberMessage(0));
    EXPECT_FALSE(Utils::HasListeners(unregistered));
    listeners.Remove(unregistered, kind);
  }
  EXPECT_EQ(Registry::FindStation(unregistered), nullptr);
  EXPECT_EQ(kivcore::utility::SmallBlockAllocator::GetStatistics().blocksInUse, blocksBefore);
  for (int kind = 0; kind < 4; ++kind) {
    SCOPED_TRACE(kind);
    const ImmutableString id = RegisterCounted();
    const int calls = listeners.Calls();
    listeners.Add(id, kind);
    EXPECT_EQ(StationLog::Factories(), kind + 1);
    EXPECT_EQ(listeners.mSafe->RefCount(), safeReferences) << "a station holds a counted reference";
    Utils::BroadcastMessage(id, NumberMessage(1));
    RunOnWorker([&] { Utils::BroadcastMessage(id, NumberMessage(2)); });  // delivers nothing off the main thread
    EXPECT_EQ(listeners.Calls(), calls + 1);
    listeners.Remove(id, kind);
    EXPECT_FALSE(Utils::HasListeners(id));
    EXPECT_FALSE(listeners.mPlain.HasBroadcaster(Registry::FindStation(id)));
    EXPECT_TRUE(DisposedAtOnce(id));
  }
  EXPECT_EQ(dialog.Count(), 0u);
}

TEST_F(StationUtilsTest, SwitchStationMovesTheListenerToTheNewestPlaceOfItsDestination) {
  const ImmutableString from = MakeCounted();
  const ImmutableString to = MakeCounted();
  const ImmutableString unregistered = Registry::UniqueStationID();
  CallLog log;
  RecordingListener mover("mover", &log);
  RecordingListener resident("resident", &log);
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

}  // namespace
