// One broadcaster against a model of its registry, over many short random
// sequences: adds and removes of all four listener kinds, listener deaths,
// stopped listeners, stopped broadcasting, and broadcasts whose handlers add,
// remove, kill listeners and broadcast again.
//
// The model does not follow the broadcaster's cursors. It numbers every
// registration as it is made and keeps, for each broadcast in progress, the
// number of the entry it served last; the next entry it serves is the
// newest one older than that. That is the whole ordering rule: newest first;
// an entry added during a broadcast is newer than anything it will serve; a
// removed entry is gone before its turn; a nested broadcast starts from the
// newest entry and serves everything; the outer one goes on after its own
// entry. Stopped plain listeners are passed over, weak and safe ones are
// served while their object lives, and dead ones are pruned as a broadcast
// passes them.
//
// The test runs in lockstep: each handler, when called, asks the model who
// should be called now and fails if it is somebody else; then it draws its
// own actions, which are applied to the library and to the model alike.
// Objects kept alive by their own delivery die when it returns; the model
// checks every object's life against the real one at each call.
#include "ModelTestSupport.h"

#include <TarnMessaging/Broadcaster.h>
#include <TarnMessaging/Listener.h>
#include <TarnMessaging/MessageImpl.h>
#include <TarnMessaging/SafeListener.h>

#include <kivcore/SmallBlockAllocator.h>

#include <boost/make_shared.hpp>
#include <boost/shared_ptr.hpp>
#include <boost/weak_ptr.hpp>

#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <deque>
#include <memory>
#include <string>
#include <vector>

namespace {

using kivcore::utility::SmallBlockAllocator;
using messaging_test::Random;
using messaging_test::SequentialExecutor;

// Carries the nesting depth of the broadcast that delivers it.
struct LevelMessage : Tarn::MessageImpl<LevelMessage> {
  explicit LevelMessage(int inDepth) : mDepth(inDepth) {}
  int mDepth;
};

constexpr int kMaxDepth = 3;
constexpr int kMaxObjects = 8;

// How an object is owned, and so how it dies.
enum class Owner { kPlain, kBoost, kStd, kSafe };
// How a registration holds it.
enum class Way { kPlain, kBoost, kStd, kSafe };

const char* WayName(Way inWay) {
  switch (inWay) {
    case Way::kPlain:
      return "plain";
    case Way::kBoost:
      return "boost";
    case Way::kStd:
      return "std";
    case Way::kSafe:
      return "safe";
  }
  return "?";
}

// What the listeners call back into: the running sequence.
class CallSink {
public:
  virtual void OnCall(int inObject, const Tarn::Message& inMessage) = 0;
  virtual void OnDeath(int inObject) = 0;

protected:
  ~CallSink() = default;
};

class ProbeListener : public Tarn::Listener {
public:
  ProbeListener(int inNumber, CallSink& inSink) : mNumber(inNumber), mSink(inSink) {}
  ~ProbeListener() override { mSink.OnDeath(mNumber); }
  void ListenToMessage(const Tarn::Message& inMessage) override { mSink.OnCall(mNumber, inMessage); }

private:
  const int mNumber;
  CallSink& mSink;
};

class ProbeSafeListener : public Tarn::SafeListenerBase {
public:
  ProbeSafeListener(int inNumber, CallSink& inSink) : mNumber(inNumber), mSink(inSink) {}
  void ListenToMessage(const Tarn::Message& inMessage) override { mSink.OnCall(mNumber, inMessage); }

protected:
  ~ProbeSafeListener() override { mSink.OnDeath(mNumber); }

private:
  const int mNumber;
  CallSink& mSink;
};

// ---------------------------------------------------------------------------
// The real objects

struct RealObject {
  Owner mOwner = Owner::kPlain;
  std::unique_ptr<ProbeListener> mPlain;
  boost::shared_ptr<ProbeListener> mBoost;
  std::shared_ptr<ProbeListener> mStd;
  Tarn::ISafeListenerRef mSafe;
  // Kept so that a weak registration can be made or removed while the object
  // lives, even after its owner has let go.
  boost::weak_ptr<Tarn::Listener> mBoostWeak;
  std::weak_ptr<Tarn::Listener> mStdWeak;
  Tarn::Listener* mListener = nullptr;  // valid while the object lives (not for safe objects)
  bool mDestroyed = false;              // set by the object's destructor
};

// ---------------------------------------------------------------------------
// The model

struct ModelEntry {
  int mToken;  // larger = newer
  int mObject;
  Way mWay;
};

struct ModelObject {
  Owner mOwner = Owner::kPlain;
  bool mOwned = true;  // the owner still holds it
  bool mAlive = true;
  bool mListening = true;
  int mStrongDeliveries = 0;  // deliveries through a weak or safe entry in progress (they keep it alive)
  int mPlainDeliveries = 0;   // deliveries through its plain entry in progress
};

struct ModelDelivery {
  int mDepth;
  int mObject;
  Way mWay;
};

class BroadcasterModel {
public:
  int AddObject(Owner inOwner) {
    ModelObject object;
    object.mOwner = inOwner;
    mObjects.push_back(object);
    return static_cast<int>(mObjects.size()) - 1;
  }
  ModelObject& Object(int inObject) { return mObjects[inObject]; }
  int ObjectCount() const { return static_cast<int>(mObjects.size()); }

  // Adding an equal registration changes nothing; a new one is the newest.
  void Add(int inObject, Way inWay) {
    if (Find(inObject, inWay) != mEntries.end()) return;
    mEntries.insert(mEntries.begin(), ModelEntry{mNextToken++, inObject, inWay});
  }
  void Remove(int inObject, Way inWay) {
    const auto found = Find(inObject, inWay);
    if (found != mEntries.end()) mEntries.erase(found);
  }
  bool Has(int inObject, Way inWay) const {
    return std::any_of(mEntries.begin(), mEntries.end(),
                       [&](const ModelEntry& inEntry) { return inEntry.mObject == inObject && inEntry.mWay == inWay; });
  }
  bool HasListeners() const { return !mEntries.empty(); }

  // The owner lets go: the object dies now, or when the last delivery that
  // keeps it alive returns.
  void Kill(int inObject) {
    ModelObject& object = mObjects[inObject];
    object.mOwned = false;
    if (object.mStrongDeliveries == 0) Die(inObject);
  }

  // A broadcast begins: it will serve every entry older than the next token.
  void BeginLevel() { mLevels.push_back(mNextToken); }
  int Depth() const { return static_cast<int>(mLevels.size()); }

  // The entry the broadcast at inDepth serves next, or null when it is done;
  // passes over stopped plain listeners and prunes dead weak and safe ones
  // on the way. Every delivery at inDepth or deeper has returned by now.
  const ModelEntry* Next(int inDepth) {
    EndDeliveriesFrom(inDepth);
    for (;;) {
      const ModelEntry* next = nullptr;
      for (const ModelEntry& entry : mEntries) {
        if (entry.mToken < mLevels[inDepth] && (next == nullptr || entry.mToken > next->mToken)) next = &entry;
      }
      if (next == nullptr) return nullptr;
      mLevels[inDepth] = next->mToken;
      const ModelObject& object = mObjects[next->mObject];
      if (next->mWay == Way::kPlain) {
        if (object.mListening) return next;
        continue;
      }
      if (object.mAlive) return next;
      Remove(next->mObject, next->mWay);
    }
  }
  void BeginDelivery(int inDepth, const ModelEntry& inEntry) {
    mDeliveries.push_back(ModelDelivery{inDepth, inEntry.mObject, inEntry.mWay});
    ModelObject& object = mObjects[inEntry.mObject];
    if (inEntry.mWay == Way::kPlain) ++object.mPlainDeliveries;
    else ++object.mStrongDeliveries;
  }
  void EndLevel() { mLevels.pop_back(); }

  // Whether a delivery through a plain entry of inObject is in progress (its
  // object must then not be destroyed by its owner).
  bool InPlainDelivery(int inObject) const { return mObjects[inObject].mPlainDeliveries > 0; }
  // Whether a delivery through that registration is in progress: a removal
  // of it from another thread waits until the delivery has returned.
  bool InDelivery(int inObject, Way inWay) const {
    return std::any_of(mDeliveries.begin(), mDeliveries.end(), [&](const ModelDelivery& inDelivery) {
      return inDelivery.mObject == inObject && inDelivery.mWay == inWay;
    });
  }

  // The entry the cursor of each running broadcast stands on: the entry it
  // is serving, or, when that entry was removed, the one that was added just
  // after it. A removal of such an entry from another thread waits until the
  // broadcast moves on, so a test that blocks the main thread on that removal
  // must not make it.
  bool UnderACursor(int inObject, Way inWay) const {
    for (int last : mLevels) {
      const ModelEntry* standing = nullptr;
      for (const ModelEntry& entry : mEntries) {
        if (entry.mToken >= last && (standing == nullptr || entry.mToken < standing->mToken)) standing = &entry;
      }
      if (standing != nullptr && standing->mObject == inObject && standing->mWay == inWay) return true;
    }
    return false;
  }

  // Deliveries at inDepth or deeper have returned: the objects they alone
  // kept alive die now.
  void EndDeliveriesFrom(int inDepth) {
    while (!mDeliveries.empty() && mDeliveries.back().mDepth >= inDepth) {
      const ModelDelivery delivery = mDeliveries.back();
      mDeliveries.pop_back();
      ModelObject& object = mObjects[delivery.mObject];
      if (delivery.mWay == Way::kPlain) {
        --object.mPlainDeliveries;
      } else if (--object.mStrongDeliveries == 0 && !object.mOwned && object.mAlive) {
        Die(delivery.mObject);
      }
    }
  }

private:
  std::vector<ModelEntry>::iterator Find(int inObject, Way inWay) {
    return std::find_if(mEntries.begin(), mEntries.end(),
                        [&](const ModelEntry& inEntry) { return inEntry.mObject == inObject && inEntry.mWay == inWay; });
  }
  // A dying listener detaches its plain registrations itself; its weak and
  // safe ones stay until a broadcast prunes them.
  void Die(int inObject) {
    mObjects[inObject].mAlive = false;
    mEntries.erase(std::remove_if(mEntries.begin(), mEntries.end(),
                                  [&](const ModelEntry& inEntry) {
                                    return inEntry.mObject == inObject && inEntry.mWay == Way::kPlain;
                                  }),
                   mEntries.end());
  }

  std::vector<ModelEntry> mEntries;  // newest first
  std::vector<ModelObject> mObjects;
  std::vector<int> mLevels;  // per running broadcast: the token of the entry served last
  std::vector<ModelDelivery> mDeliveries;
  int mNextToken = 1;
};

// ---------------------------------------------------------------------------
// One random sequence

class Sequence : public CallSink {
public:
  Sequence(std::uint64_t inSeed, SequentialExecutor& inHelper) : mRandom(inSeed), mHelper(inHelper) {}
  Sequence(const Sequence&) = delete;
  Sequence& operator=(const Sequence&) = delete;
  ~Sequence() {
    // Whatever is still alive goes before the broadcaster.
    for (RealObject& object : mReal) DropOwner(object);
  }

  void Run(int inSteps) {
    for (int i = 0; i < 3; ++i) CreateObject();
    for (int step = 0; step < inSteps && !::testing::Test::HasFailure(); ++step) {
      mDescription.clear();
      TopLevelStep();
      SCOPED_TRACE("step " + std::to_string(step) + ": " + mDescription);
      CompareRegistry();
      CompareLives();
    }
  }

  // Kills every object, lets a broadcast prune what is left, and checks that
  // nothing remains.
  void Finish() {
    SCOPED_TRACE("finishing the sequence: " + mDescription);
    if (::testing::Test::HasFailure()) return;
    mBroadcaster.StartBroadcasting();
    for (int object = 0; object < mModel.ObjectCount(); ++object) {
      if (mModel.Object(object).mOwned) Kill(object);
    }
    Broadcast(0);
    CompareLives();
    EXPECT_FALSE(mBroadcaster.HasListeners()) << "registrations left after every listener died";
  }

  void OnCall(int inObject, const Tarn::Message& inMessage) override {
    if (mDiverged) return;
    const int depth = static_cast<const LevelMessage&>(inMessage).mDepth;
    if (depth >= mModel.Depth()) {
      Diverge("object " + std::to_string(inObject) + " called by a broadcast that should deliver nothing");
      return;
    }
    if (depth != mModel.Depth() - 1) {
      Diverge("a call at depth " + std::to_string(depth) + " while depth " + std::to_string(mModel.Depth() - 1) +
              " is the innermost");
      return;
    }
    const ModelEntry* expected = mModel.Next(depth);
    if (expected == nullptr || expected->mObject != inObject) {
      Diverge("object " + std::to_string(inObject) + " called at depth " + std::to_string(depth) + "; the model expected " +
              (expected == nullptr ? std::string("nobody")
                                   : "object " + std::to_string(expected->mObject) + " (" + WayName(expected->mWay) + ")"));
      return;
    }
    CompareLives();
    mModel.BeginDelivery(depth, *expected);
    mDescription += " [d" + std::to_string(depth) + " calls " + std::to_string(inObject) + "]";
    const int actions = mRandom.Percent(60) ? 0 : mRandom.Between(1, 2);
    for (int i = 0; i < actions && !mDiverged; ++i) Act(depth + 1);
  }

  void OnDeath(int inObject) override { mReal[inObject].mDestroyed = true; }

private:
  void Diverge(const std::string& inWhat) {
    ADD_FAILURE() << inWhat << "\nafter: " << mDescription;
    mDiverged = true;
  }

  int CreateObject() {
    const Owner owner = static_cast<Owner>(mRandom.Below(4));
    const int number = mModel.AddObject(owner);
    mReal.emplace_back();
    RealObject& object = mReal.back();
    object.mOwner = owner;
    switch (owner) {
      case Owner::kPlain:
        object.mPlain = std::make_unique<ProbeListener>(number, *this);
        object.mListener = object.mPlain.get();
        break;
      case Owner::kBoost:
        object.mBoost = boost::make_shared<ProbeListener>(number, *this);
        object.mBoostWeak = object.mBoost;
        object.mListener = object.mBoost.get();
        break;
      case Owner::kStd:
        object.mStd = std::make_shared<ProbeListener>(number, *this);
        object.mStdWeak = object.mStd;
        object.mListener = object.mStd.get();
        break;
      case Owner::kSafe:
        object.mSafe = Tarn::ISafeListenerRef(new ProbeSafeListener(number, *this));
        break;
    }
    mDescription += " create " + std::to_string(number);
    return number;
  }

  static void DropOwner(RealObject& ioObject) {
    ioObject.mPlain.reset();
    ioObject.mBoost.reset();
    ioObject.mStd.reset();
    ioObject.mSafe = nullptr;
  }

  // The ways an object can be registered: by plain pointer (any Listener),
  // and by the weak or counted reference that matches its owner.
  Way AnyWayFor(int inObject) {
    const Owner owner = mModel.Object(inObject).mOwner;
    if (owner == Owner::kSafe) return Way::kSafe;
    if (owner == Owner::kPlain || mRandom.Percent(40)) return Way::kPlain;
    return owner == Owner::kBoost ? Way::kBoost : Way::kStd;
  }
  // Whether the test can name the object in that way now.
  bool CanReach(int inObject, Way inWay) {
    const ModelObject& object = mModel.Object(inObject);
    if (!object.mAlive) return false;
    return inWay != Way::kSafe || object.mOwned;  // a new counted reference would revive the object
  }

  void AddReal(int inObject, Way inWay) {
    RealObject& object = mReal[inObject];
    switch (inWay) {
      case Way::kPlain:
        mBroadcaster.AddListener(object.mListener);
        break;
      case Way::kBoost:
        mBroadcaster.AddListener(object.mBoostWeak);
        break;
      case Way::kStd:
        mBroadcaster.AddListener(object.mStdWeak);
        break;
      case Way::kSafe:
        mBroadcaster.AddListener(object.mSafe);
        break;
    }
  }
  void RemoveReal(int inObject, Way inWay) {
    RealObject& object = mReal[inObject];
    switch (inWay) {
      case Way::kPlain:
        mBroadcaster.RemoveListener(object.mListener, true);
        break;
      case Way::kBoost:
        mBroadcaster.RemoveListener(object.mBoostWeak);
        break;
      case Way::kStd:
        mBroadcaster.RemoveListener(object.mStdWeak);
        break;
      case Way::kSafe:
        mBroadcaster.RemoveListener(object.mSafe);
        break;
    }
  }

  void Kill(int inObject) {
    mDescription += " kill " + std::to_string(inObject);
    DropOwner(mReal[inObject]);
    mModel.Kill(inObject);
  }

  // A broadcast at inDepth (0: from the test itself), and its end.
  void Broadcast(int inDepth) {
    mDescription += " broadcast@" + std::to_string(inDepth);
    const bool delivers = mBroadcaster.IsBroadcasting();
    if (delivers) mModel.BeginLevel();
    mBroadcaster.BroadcastMessage(LevelMessage(inDepth));
    if (!delivers || mDiverged) return;
    const ModelEntry* missed = mModel.Next(inDepth);
    if (missed != nullptr) {
      Diverge("the broadcast at depth " + std::to_string(inDepth) + " ended without calling object " +
              std::to_string(missed->mObject) + " (" + WayName(missed->mWay) + ")");
      return;
    }
    mModel.EndLevel();
  }

  // A random object that lives, or -1.
  int AnyLivingObject() {
    std::vector<int> living;
    for (int object = 0; object < mModel.ObjectCount(); ++object)
      if (mModel.Object(object).mAlive) living.push_back(object);
    if (living.empty()) return -1;
    return living[mRandom.Below(static_cast<std::uint32_t>(living.size()))];
  }
  int LivingCount() {
    int count = 0;
    for (int object = 0; object < mModel.ObjectCount(); ++object) count += mModel.Object(object).mAlive ? 1 : 0;
    return count;
  }

  // One random action, from the test (inDepth 0) or from a handler (inDepth
  // = the depth a broadcast it starts would have).
  void Act(int inDepth) {
    static const std::uint32_t kWeights[] = {
        3,   // 0 create an object
        10,  // 1 add
        6,   // 2 remove
        3,   // 3 kill
        3,   // 4 stop or start listening
        1,   // 5 stop or start broadcasting
        6,   // 6 broadcast (nested when in a handler)
        3,   // 7 add or remove on the helper thread
    };
    switch (mRandom.Weighted(kWeights)) {
      case 0:
        if (LivingCount() < kMaxObjects) CreateObject();
        return;
      case 1: {
        const int object = AnyLivingObject();
        if (object < 0) return;
        const Way way = AnyWayFor(object);
        if (!CanReach(object, way)) return;
        mDescription += std::string(" add ") + std::to_string(object) + "/" + WayName(way);
        AddReal(object, way);
        mModel.Add(object, way);
        return;
      }
      case 2: {
        const int object = AnyLivingObject();
        if (object < 0) return;
        const Way way = AnyWayFor(object);
        if (!CanReach(object, way)) return;
        mDescription += std::string(" remove ") + std::to_string(object) + "/" + WayName(way);
        RemoveReal(object, way);
        mModel.Remove(object, way);
        return;
      }
      case 3: {
        const int object = AnyLivingObject();
        // A listener must not be destroyed by its owner while a delivery
        // through its plain pointer runs; weak and safe deliveries keep
        // their object alive themselves.
        if (object < 0 || !mModel.Object(object).mOwned || mModel.InPlainDelivery(object)) return;
        Kill(object);
        return;
      }
      case 4: {
        const int object = AnyLivingObject();
        if (object < 0 || mModel.Object(object).mOwner == Owner::kSafe) return;
        const bool listen = mRandom.Percent(60);
        mDescription += std::string(listen ? " start " : " stop ") + std::to_string(object);
        if (listen) mReal[object].mListener->StartListening();
        else mReal[object].mListener->StopListening();
        mModel.Object(object).mListening = listen;
        return;
      }
      case 5: {
        const bool on = mRandom.Percent(70);
        mDescription += on ? " start broadcasting" : " stop broadcasting";
        if (on) mBroadcaster.StartBroadcasting();
        else mBroadcaster.StopBroadcasting();
        return;
      }
      case 6:
        if (inDepth <= kMaxDepth) Broadcast(inDepth);
        return;
      case 7: {
        const int object = AnyLivingObject();
        if (object < 0) return;
        const Way way = AnyWayFor(object);
        if (!CanReach(object, way)) return;
        const bool add = mRandom.Percent(50);
        // The test waits for the helper, so the helper must not wait for
        // the test: no removal of a registration being delivered to (or
        // under a broadcast's cursor) while the main thread is in a handler.
        if (!add && (mModel.InDelivery(object, way) || mModel.UnderACursor(object, way))) return;
        mDescription += std::string(add ? " helper adds " : " helper removes ") + std::to_string(object) + "/" + WayName(way);
        mHelper.Run([&] {
          if (add) AddReal(object, way);
          else RemoveReal(object, way);
        });
        if (add) mModel.Add(object, way);
        else mModel.Remove(object, way);
        return;
      }
    }
  }

  void TopLevelStep() {
    if (mRandom.Percent(35)) {
      Broadcast(0);
    } else {
      Act(0);
    }
  }

  // What the registry answers, against the model (outside any broadcast).
  void CompareRegistry() {
    if (mDiverged) return;
    EXPECT_EQ(mModel.HasListeners(), mBroadcaster.HasListeners()) << "HasListeners";
    for (int object = 0; object < mModel.ObjectCount(); ++object) {
      if (!mModel.Object(object).mAlive || mModel.Object(object).mOwner == Owner::kSafe) continue;
      Tarn::Listener* listener = mReal[object].mListener;
      const bool plain = mModel.Has(object, Way::kPlain);
      EXPECT_EQ(plain, mBroadcaster.HasListener(listener)) << "HasListener(" << object << ")";
      EXPECT_EQ(plain, listener->HasBroadcaster(&mBroadcaster)) << "back-link of " << object;
    }
  }

  // Which objects live, against the model.
  void CompareLives() {
    for (int object = 0; object < mModel.ObjectCount(); ++object) {
      if (mReal[object].mDestroyed == !mModel.Object(object).mAlive) continue;
      Diverge("object " + std::to_string(object) + (mReal[object].mDestroyed ? " is destroyed" : " still lives") +
              " but the model says otherwise");
      return;
    }
  }

  Random mRandom;
  SequentialExecutor& mHelper;
  BroadcasterModel mModel;
  std::deque<RealObject> mReal;  // by object number; grows (references stay valid), never shrinks
  std::string mDescription;
  bool mDiverged = false;
  Tarn::Broadcaster mBroadcaster;  // last: destroyed first, after the objects have gone
};

TEST(BroadcasterModelTest, RandomSequencesMatchTheModel) {
  messaging_test::MainThreadGuard mainThread;
  messaging_test::RunRandomSequences<Sequence>("broadcaster", 10000, 0xb40adca5);
}

}  // namespace
