// Exhausted small-block storage at every allocation of each public operation:
// the k-th allocation fails, for k = 0, 1, ... until the operation completes.
// Each attempt either completes or raises std::bad_alloc; afterwards a
// listener hears exactly what was attached, the operation succeeds when tried
// again, and once the attempt is undone every small block is back. Undoing
// (removals, disposals, Terminate) runs with storage available, so the sweep
// does not depend on whether a removal allocates.
#include "TestSupport.h"

#include <TarnMessaging.h>

#include <boost/function.hpp>
#include <boost/make_shared.hpp>

namespace {

using kivcore::utility::SmallBlockAllocator;
using messaging_test::NumberMessage;

struct Scene {
  Tarn::Broadcaster mBroadcaster;
  messaging_test::RecordingListener mPlain{"plain"};
  boost::shared_ptr<messaging_test::RecordingListener> mBoost = boost::make_shared<messaging_test::RecordingListener>("boost");
  std::shared_ptr<messaging_test::RecordingListener> mStd = std::make_shared<messaging_test::RecordingListener>("std");
  kivcore::utility::ImmutableString mStation = Tarn::StationRegistry::UniqueStationID();  // not registered yet
  std::unique_ptr<Tarn::IdleCountdownTimer> mTimer;

  int Calls() const { return mPlain.Calls() + mBoost->Calls() + mStd->Calls(); }
  void AttachAndBroadcast() {
    Tarn::StationRegistry::RegisterStation(mStation, nullptr);
    Tarn::StationUtils::AddListener(mStation, &mPlain);
    mBroadcaster.AddListener(boost::weak_ptr<Tarn::Listener>(mBoost));
    mBroadcaster.AddListener(std::weak_ptr<Tarn::Listener>(mStd));
    mBroadcaster.AddListener(Tarn::ISafeListenerRef(new messaging_test::CountedSafeListener("safe")));
    mBroadcaster.BroadcastMessage(NumberMessage(1));
    Tarn::StationUtils::BroadcastMessage(mStation, NumberMessage(1));
  }
  void DisposedInItsOwnBroadcast(bool inByID) {
    mStation = Tarn::StationRegistry::RegisterUniqueStation();
    mPlain.SetAction([id = mStation](const Tarn::Message&) { Tarn::StationRegistry::DisposeStation(id); });
    Tarn::StationUtils::AddListener(mStation, &mPlain);
    if (inByID) Tarn::StationUtils::BroadcastMessage(mStation, NumberMessage(1));
    else Tarn::StationRegistry::FindStation(mStation)->BroadcastMessage(NumberMessage(1));
  }
  void FireTimer() {
    if (!mTimer) mTimer = std::make_unique<Tarn::IdleCountdownTimer>();
    Tarn::StationUtils::AddListener(mTimer->GetStationID(), &mPlain);
    mTimer->ArmTimer();
    Tarn::StationUtils::BroadcastMessage(Tarn::kStation_Idle, Tarn::ApplicationIdleMessage());
  }
};

TEST(AllocationFailure, EveryOperationThrowsBadAllocOrCompletesAndLeavesTheLibraryUsableAndNothingLeaked) {
  messaging_test::MainThreadGuard mainThread;
  messaging_test::ExceptionRecorder failuresInsideDeliveries;  // GuardedCall hands them over
  // Each operation, and what it must amount to when done again with storage.
  const std::vector<std::pair<std::function<void(Scene&)>, int>> operations = {
      {[](Scene&) { delete NumberMessage(1).Clone(); }, 0},
      {[](Scene&) { NumberMessage(2).CreateCallback(Tarn::kStation_Idle)(); }, 0},
      {[](Scene& s) { s.mStation = Tarn::StationRegistry::RegisterUniqueStation(); }, 0},
      {[](Scene& s) { s.AttachAndBroadcast(); }, 3},
      {[](Scene& s) { s.FireTimer(); }, 1},
      // A station disposed of by a handler of its own broadcast: made by ID
      // (the call's release completes the disposal) and made on the station.
      {[](Scene& s) { s.DisposedInItsOwnBroadcast(true); }, 1},
      {[](Scene& s) { s.DisposedInItsOwnBroadcast(false); }, 1},
  };
  for (const auto& [operation, callsWhenDone] : operations) {
    for (long long k = -1;; ++k) {  // -1: a first run that never fails, for what is made once per process
      SCOPED_TRACE("operation " + std::to_string(&operation - &operations[0].first) + ", failing after " +
                   std::to_string(k) + " allocations");
      const std::size_t blocksBefore = SmallBlockAllocator::GetStatistics().blocksInUse;
      bool completed = false;
      {
        Tarn::Messaging::Initialize();
        Scene scene;
        const std::size_t swallowedBefore = failuresInsideDeliveries.Count();
        SmallBlockAllocator::SetFailAfter(k);
        try {
          operation(scene);
          completed = failuresInsideDeliveries.Count() == swallowedBefore;
        } catch (const std::bad_alloc&) {
        }
        SmallBlockAllocator::SetFailAfter(-1);
        // Whatever a failure left attached heard the broadcast once at most,
        // and a plain listener is never held without its back-link.
        EXPECT_TRUE(completed ? scene.Calls() == callsWhenDone : scene.Calls() <= callsWhenDone) << scene.Calls();
        Tarn::Station* const station = Tarn::StationRegistry::FindStation(scene.mStation);
        EXPECT_TRUE(station == nullptr || station->HasListener(&scene.mPlain) == scene.mPlain.HasBroadcaster(station));
        if (!completed) {
          const int before = scene.Calls();
          operation(scene);  // the library is usable: the operation now succeeds
          EXPECT_EQ(scene.Calls() - before, callsWhenDone);
        }
        scene.mTimer.reset();
        Tarn::StationRegistry::DisposeStation(scene.mStation);
        Tarn::Messaging::Terminate();
      }
      EXPECT_TRUE(k < 0 || SmallBlockAllocator::GetStatistics().blocksInUse == blocksBefore) << "blocks leaked";
      if (HasFailure() || (completed && k >= 0) || k > 300) break;
    }
  }
}

}  // namespace
