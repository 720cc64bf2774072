// Exhausted small-block storage at every allocation of each public operation:
// the k-th allocation fails, for k = 0, 1, ... until the operation completes.
// Each attempt either completes or raises std::bad_alloc; afterwards what
// completed works, what failed left no trace, the library serves the next
// operation, and every small block is back once the attempt is undone. The
// undoing (removals, disposals, Terminate) runs with storage available.
#include "TestSupport.h"

#include <TarnMessaging.h>

#include <TarnFoundation/TimeStamp.h>

#include <boost/function.hpp>
#include <boost/make_shared.hpp>

#include <gtest/gtest.h>

#include <functional>
#include <memory>
#include <new>
#include <string>

namespace {

using kivcore::utility::ImmutableString;
using kivcore::utility::SmallBlockAllocator;
using messaging_test::NumberMessage;
using messaging_test::RecordingListener;

std::size_t BlocksInUse() { return SmallBlockAllocator::GetStatistics().blocksInUse; }

struct Scene {
  Tarn::Broadcaster mBroadcaster;
  RecordingListener mPlain{"plain"};
  boost::shared_ptr<RecordingListener> mBoost = boost::make_shared<RecordingListener>("boost");
  std::shared_ptr<RecordingListener> mStd = std::make_shared<RecordingListener>("std");
  Tarn::ISafeListenerRef mSafe{new messaging_test::CountedSafeListener("safe")};
  ImmutableString mStation = Tarn::StationRegistry::UniqueStationID();  // not registered, not made
  std::unique_ptr<Tarn::IdleCountdownTimer> mTimer;
};

struct Operation {
  const char* mName;
  std::function<void(Scene&)> mRun;              // under exhausted storage
  std::function<void(Scene&, bool)> mCheck;      // completed or not; storage back
};

int Heard(Scene& inScene, const Tarn::Message& inMessage) {
  const int before = inScene.mPlain.Calls();
  Tarn::StationUtils::BroadcastMessage(inScene.mStation, inMessage);
  return inScene.mPlain.Calls() - before;
}

const std::vector<Operation>& Operations() {
  static const std::vector<Operation> operations = {
      {"Clone", [](Scene&) { delete NumberMessage(1).Clone(); }, nullptr},
      {"CreateCallback", [](Scene&) { NumberMessage(2).CreateCallback(Tarn::kStation_Idle)(); }, nullptr},
      {"RegisterStation and its first use",
       [](Scene& s) {
         Tarn::StationRegistry::RegisterStation(s.mStation, nullptr);
         Tarn::StationUtils::AddListener(s.mStation, &s.mPlain);
       },
       [](Scene& s, bool inCompleted) {
         // A failure either left the ID unregistered or registered without
         // the listener; the operation succeeds when tried again.
         EXPECT_EQ(Heard(s, NumberMessage(3)), inCompleted ? 1 : 0);
         Tarn::StationRegistry::RegisterStation(s.mStation, nullptr);
         Tarn::StationUtils::AddListener(s.mStation, &s.mPlain);
         EXPECT_EQ(Heard(s, NumberMessage(3)), 1);
       }},
      {"RegisterUniqueStation", [](Scene& s) { s.mStation = Tarn::StationRegistry::RegisterUniqueStation(); },
       nullptr},
      {"Broadcaster::AddListener of every kind, then a broadcast",
       [](Scene& s) {
         s.mBroadcaster.AddListener(&s.mPlain);
         s.mBroadcaster.AddListener(boost::weak_ptr<Tarn::Listener>(s.mBoost));
         s.mBroadcaster.AddListener(std::weak_ptr<Tarn::Listener>(s.mStd));
         s.mBroadcaster.AddListener(s.mSafe);
         s.mBroadcaster.BroadcastMessage(NumberMessage(4));
       },
       [](Scene& s, bool inCompleted) {
         // Whatever was added hears a broadcast exactly once, and a plain
         // listener is never held without its back-link.
         EXPECT_EQ(s.mPlain.HasBroadcaster(&s.mBroadcaster), s.mBroadcaster.HasListener(&s.mPlain));
         const int plain = s.mPlain.Calls(), boost = s.mBoost->Calls(), std = s.mStd->Calls();
         s.mBroadcaster.BroadcastMessage(NumberMessage(5));
         EXPECT_EQ(s.mPlain.Calls() - plain, s.mBroadcaster.HasListener(&s.mPlain) ? 1 : 0);
         EXPECT_LE(s.mBoost->Calls() - boost, 1);
         EXPECT_LE(s.mStd->Calls() - std, 1);
         if (inCompleted) {
           EXPECT_EQ(s.mPlain.Calls() + s.mBoost->Calls() + s.mStd->Calls(), 6);
         }
       }},
      {"IdleCountdownTimer made, armed and fired",
       [](Scene& s) {
         s.mTimer = std::make_unique<Tarn::IdleCountdownTimer>();
         Tarn::StationUtils::AddListener(s.mTimer->GetStationID(), &s.mPlain);
         s.mTimer->ArmTimer();
         Tarn::StationUtils::BroadcastMessage(Tarn::kStation_Idle, Tarn::ApplicationIdleMessage());
       },
       [](Scene& s, bool) {
         // A failure inside the firing goes to the error manager with the
         // idle broadcast's other exceptions; the timer fires at most once.
         EXPECT_LE(s.mPlain.Calls(), 1);
         if (!s.mTimer) return;
         s.mTimer->ArmTimer();  // usable again: it fires at most once more
         const int before = s.mPlain.Calls();
         Tarn::StationUtils::AddListener(s.mTimer->GetStationID(), &s.mPlain);
         Tarn::StationUtils::BroadcastMessage(Tarn::kStation_Idle, Tarn::ApplicationIdleMessage());
         EXPECT_EQ(s.mPlain.Calls(), before + 1);
         s.mTimer.reset();
       }},
  };
  return operations;
}

TEST(AllocationFailure, EveryOperationThrowsBadAllocOrCompletesAndLeavesTheLibraryUsableAndNothingLeaked) {
  messaging_test::MainThreadGuard mainThread;
  messaging_test::ExceptionRecorder failuresInHandlers;
  Tarn::TimeStamp::SetClockForTesting([] { return 1000.0; });
  for (const Operation& operation : Operations()) {
    for (long long k = -1;; ++k) {  // -1: a first run that never fails, for caches made on first use
      SCOPED_TRACE(std::string(operation.mName) + ", failing after " + std::to_string(k) + " allocations");
      const std::size_t baseline = BlocksInUse();
      bool completed = false;
      {
        Tarn::Messaging::Initialize();
        Scene scene;
        SmallBlockAllocator::SetFailAfter(k);
        try {
          operation.mRun(scene);
          completed = true;
        } catch (const std::bad_alloc&) {
        }
        SmallBlockAllocator::SetFailAfter(-1);
        if (operation.mCheck) operation.mCheck(scene, completed);
        scene.mTimer.reset();
        scene.mBroadcaster.RemoveListener(&scene.mPlain, true);
        Tarn::StationRegistry::DisposeStation(scene.mStation);
        Tarn::Messaging::Terminate();
      }
      if (k >= 0) {
        EXPECT_EQ(BlocksInUse(), baseline) << "small blocks leaked";
      }
      if (HasFailure() || (completed && k >= 0) || k > 300) {
        EXPECT_TRUE(completed) << "never completed";
        break;
      }
    }
  }
  Tarn::TimeStamp::SetClockForTesting(std::function<double()>());
}

}  // namespace
