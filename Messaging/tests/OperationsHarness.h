// One model of the library's operations over its public API, driven two
// ways: on seeded random sequences by OperationsModelTest (ctest), and on
// fuzzer bytes by fuzz/OperationsFuzzer.cpp (libFuzzer). Every choice comes
// from a Choices object, so the same checks serve both drivers.
//
//   SeededChoices choices(seed);                       // or bytes from libFuzzer
//   std::string failure = operations_harness::RunSequence(choices, 60);
//   if (!failure.empty()) ...                          // what went wrong, and the operations that led there
//
// The world: a broadcaster of the harness's own (node 0), three registry
// stations made by a factory that reports their lives (nodes 1-3), the idle
// station (node 4), five listener slots of five kinds (plain pointer,
// boost::weak_ptr, std::weak_ptr, safe listener, subscription), an idle
// countdown timer, two cancel tokens.
// Operations: listeners made, attached and detached (by the broadcaster, the
// utilities, or registrations of Tarn::Attach made and reset), stopped and
// killed; subscriptions made and reset, from their own handlers too;
// broadcasting stopped and started; broadcasts, also nested from handlers;
// stations attached as relays to the broadcaster or to lower stations (chains,
// never cycles); register, retain, find, release and dispose; timers made,
// armed and destroyed; posts of every kind (plain, coalesced under the type's
// or a caller's key, cancellable, idle-time), cancels, runs of the pending
// calls; the last Terminate, from the top, from handlers and from posted
// calls. After a Terminate in a handler the library is initialized again
// there, or on another thread that works as the main thread while the
// handler's thread waits; after a step that terminated, here or on a new
// thread that takes the rest of the sequence over (the main thread moves).
// Handlers run operations too, and some operations run on a helper thread
// while the main thread waits (inside a handler as well).
//
// Allocation failure: a quarter of the operations make their library call
// with the n-th heap or small-block allocation failing. A call that throws
// std::bad_alloc must leave the library as it was (the model goes back to
// where it was before the operation, and everything above is checked against
// it); a call that returns must have done all it said.
//
// The model numbers every registration; a running broadcast serves the newest
// entry older than the one it served last and never one added after it
// began. Relays are broadcasts of their own inside the delivery to the
// station. Each listener call is checked against the model when it happens
// (lockstep), and after each step: every station's life, every plain
// registration and back-link, every listener's life. A station must never be
// deleted while a broadcast on it runs; one disposed of meanwhile goes when
// that broadcast ends, and one a worker let go is gone once the main thread
// has run its posted calls and disposed of a registered station, or made the
// last Terminate. Posts are checked as a run delivers them: in the order
// queued, none cancelled, replaced or dropped, and each heard by every
// listener of its station (and of the stations relaying it) as often as the
// model says. After the final Terminate no station or listener may remain and
// every small block must be back. Any contract report is a failure: the
// harness makes no bad calls.
//
// RunConcurrent is the same library under real concurrency: two workers make,
// relay and let go of stations and listeners while the main thread broadcasts
// through them; then a worker adds, posts and removes on a well-known station
// while the main thread terminates and initializes, over and over. No call
// may follow a removal that returned.
//
// Threading: one sequence at a time, from the thread that is to be the main
// thread. A helper operation that does not return within 20 s (a deadlock),
// a station deleted while a broadcast on it runs (the library would go on in
// freed memory), and a subscription's handler destroyed while it runs stop the
// process at once with the trace. The statistics are for one thread at a time.
#pragma once

#include "HeapFailure.h"

#include <TarnMessaging.h>

#include <kivcore/kivcore.h>

#include <boost/make_shared.hpp>

#include <algorithm>
#include <atomic>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <future>
#include <memory>
#include <random>
#include <string>
#include <utility>
#include <vector>

namespace operations_harness {

using kivcore::utility::ImmutableString;
using kivcore::utility::SmallBlockAllocator;
namespace Registry = Tarn::StationRegistry;
namespace Utils = Tarn::StationUtils;

// Where the harness's choices come from.
struct Choices {
  virtual std::uint32_t Below(std::uint32_t inBound) = 0;  // in [0, inBound); inBound > 0
  virtual bool Exhausted() = 0;
  virtual std::string Replay() { return std::string(); }  // how to run this sequence again
};

struct Ping : Tarn::MessageImpl<Ping> {};
struct Posted : Tarn::MessageImpl<Posted> {
  explicit Posted(int inNumber) : mNumber(inNumber) {}
  int mNumber;
};
inline int PostNumber(const Tarn::Message& inMessage) {
  return inMessage.GetMessageID() == Posted::StaticMessageID() ? static_cast<const Posted&>(inMessage).mNumber : 0;
}

constexpr int kSlots = 5, kNodes = 5, kIdle = 4, kMaxLevels = 3, kMaxHandlerActions = 200;
// An operation's failing allocation is one of the first kFailPoints on the heap or in small-block storage.
constexpr int kFailPoints = 6;
// Entry.mWho of the timer, and of a weak or safe entry whose object died before its slot was reused; kSlots + n:
// station n as a relay.
constexpr int kTimer = kSlots + kNodes, kGone = -1;
enum Way { kPlain, kBoost, kStd, kSafe, kSub };  // kSub: a subscription (Tarn::Subscribe), held by plain pointer

class Harness;
inline Harness* sHarness = nullptr;
inline std::atomic<int> sLiveStations{0};
// What the sequences ran so far: library calls made with an allocation failure drawn, those that threw, and the
// times the main thread moved to another thread.
inline struct Statistics { long long mFailingCalls = 0, mThrown = 0, mMoves = 0; } sStatistics;
void Called(int inSlot, int inPost = 0);  // inPost: the number of the post delivered, 0: a broadcast
void Destroyed(int inSlot);
void StationLife(int inNode, Tarn::Station* inStation);  // null: deleted

// A listener in slot mSlot, of either base: Tarn::Listener, or the safe listeners' base.
template <class Base>
struct Probe : Base {
  explicit Probe(int inSlot) : mSlot(inSlot) {}
  ~Probe() override { Destroyed(mSlot); }
  void ListenToMessage(const Tarn::Message& inMessage) override { Called(mSlot, PostNumber(inMessage)); }
  const int mSlot;
};
using PlainProbe = Probe<Tarn::Listener>;

// A subscription's handler: the slot's object lives as long as the handler. It reads what it captured after the
// call as well, which must still be there then, whatever the call did to its registration.
struct Handler {
  explicit Handler(int inSlot) : mSlot(std::make_unique<int>(inSlot)) {}
  Handler(Handler&&) = default;
  ~Handler() { mSlot ? Destroyed(*mSlot) : void(); }
  void operator()(const Ping&) const { const int slot = *mSlot; Called(slot), *mSlot != slot ? Destroyed(kGone) : void(); }
  std::unique_ptr<int> mSlot;
};

// Reports its life for node mNode (1-4); -1: counted only.
struct TrackedStation : Tarn::Station {
  TrackedStation(const ImmutableString& inStationID, int inNode) : Tarn::Station(inStationID), mNode(inNode) {
    ++sLiveStations, StationLife(mNode, this);
  }
  ~TrackedStation() override { --sLiveStations, StationLife(mNode, nullptr); }
  const int mNode;
};

// What a main thread does for workers: runs their posted calls, deletes the stations they disposed of.
inline void Drain() { Utils::FlushPostedMessagesOnUIThread(), Registry::DisposeStation(Registry::RegisterUniqueStation()); }

inline Tarn::Station* MakeCounted(const ImmutableString& inStationID) { return new TrackedStation(inStationID, -1); }
Tarn::Station* MakeTracked(const ImmutableString& inStationID);

struct Entry {
  int mToken, mWho, mWay;  // mToken: larger = newer; mWho: a slot, kSlots + a station relaying, kTimer or kGone
};

struct Node {
  std::vector<Entry> mEntries;
  bool mBroadcasting = true, mRegistered = false, mDisposeRequested = false;
  // mMade: the station object lives (node 0: always); mDoomed: no longer registered, and deleted once no broadcast
  // on it runs.
  bool mMade = false, mDoomed = false;
  // mHeld: the retains the harness took and will release; mFrames: broadcasts on it in progress.
  int mRetains = 0, mHeld = 0, mFrames = 0;
};

struct Object {
  int mKind = -1;  // a Way; -1: never made
  bool mOwned = false, mAlive = false, mListening = true, mDestroyed = false;
  int mHolds = 0;           // weak or safe deliveries in progress, each keeping it alive
  int mLinks[kNodes] = {};  // back-link records the listener holds, per node
};

// What the harness holds of a slot's listener: the object, and the registrations of Tarn::Attach per node, for
// plain-pointer and for its own way, each with the life of the node it was made in.
struct Handles {
  std::unique_ptr<PlainProbe> mPlain;
  boost::shared_ptr<PlainProbe> mBoost;
  std::shared_ptr<PlainProbe> mStd;
  Tarn::ISafeListenerRef mSafe;
  Tarn::Listener* mListener = nullptr;  // while owned; null for safe listeners
  Tarn::Registration mAttached[kNodes][2];
  int mLife[kNodes][2] = {};
};

struct Queued {
  int mNumber, mNode, mKind, mKey;  // mKind: see Harness::Post; mKey: a coalesced post's caller key (-1: its type's), a cancellable post's token
};

struct Frame {
  int mNode, mLast;            // mLast: token served last (at first: the first it must not serve)
  int mWho = -1, mWay = kPlain;  // the slot being delivered to, or -1
};

class Harness {
public:
  explicit Harness(Choices& ioChoices) : mChoices(ioChoices) {
    sHarness = this;
    mPreviousErrors = kivcore::config::SetErrorHandler(
        [](const kivcore::config::ErrorReport& inReport) { sHarness->Fail("contract report: " + inReport.key); });
    mPreviousExceptions = kivcore::config::ErrorManager::SetExceptionHandler(
        [](std::exception_ptr) { sHarness->Fail("an exception left a handler"); });
    mIDs[kIdle] = Tarn::kStation_Idle;
    Initialize();
    for (int node = 1; node < kIdle; ++node) mIDs[node] = Registry::UniqueStationID(), RegistryOp(node, 0, false);
  }
  ~Harness() {
    kivcore::config::SetErrorHandler(std::move(mPreviousErrors)), sHarness = nullptr;
    kivcore::config::ErrorManager::SetExceptionHandler(std::move(mPreviousExceptions));
  }

  // Runs at most inSteps steps from inStep, then Finish. A step that leaves the library terminated initializes it
  // again, here or, now and then, on a new thread that runs the rest of the sequence: the main thread moves.
  std::string Run(int inSteps, int inStep = 0) {
    for (int step = inStep; step < inSteps && mFailure.empty() && !mChoices.Exhausted(); ++step) {
      Note("\n%d:", step);
      Act(0);
      std::string failure;
      if (!mMain && Pick(4) == 0)
        return Note(" move"), ++sStatistics.mMoves, OnThread(true, [&] { Initialize(), Compare(), failure = Run(inSteps, step + 1); }), failure;
      if (!mMain) Initialize();
      Compare();
    }
    return Finish();
  }

  // Lets everything go, terminates the library, and returns the first
  // failure with the operations that led to it (empty: none).
  std::string Finish() {
    Note("\nfinish:");
    for (int slot = 0; slot < kSlots; ++slot) Kill(slot, false);
    Terminate();
    Compare();
    if (sLiveStations != 0) Fail("stations outlived Terminate");
    return mFailure;
  }

  void Fail(const std::string& inWhat) { mFailure += mFailure.empty() ? inWhat + "\noperations:" + mTrace : ""; }
  // The library goes on in freed memory after this: stop here, with the trace.
  [[noreturn]] void Fatal(const char* inWhat) {
    Fail(inWhat), std::fprintf(stderr, "operations harness: %s\n%s\n", mFailure.c_str(), mChoices.Replay().c_str());
    std::abort();
  }

  // A probe was called: the model must name it, then its handler acts.
  void OnCall(int inSlot) {
    if (!mFailure.empty()) return;
    const int expected = mLevels.empty() ? -1 : Next();
    if (expected != inSlot) return Fail("slot " + std::to_string(inSlot) + " called; the model expects " + std::to_string(expected));
    Note(" [%d]", inSlot);
    mStale = false;
    const int actions = Pick(5) < 3 || mHandlerActions >= kMaxHandlerActions ? 0 : 1 + Pick(2);
    for (int action = 0; action < actions && mFailure.empty(); ++action, ++mHandlerActions) Act(static_cast<int>(mLevels.size()), inSlot);
    mStale = true;
  }
  // A post was delivered: one the current run is to deliver, not before one delivered already. Its handler may
  // make the last Terminate (outside broadcasts the model walks).
  void OnPosted(int inSlot, int inPost) {
    if (!mFailure.empty()) return;
    const auto post = std::find_if(mRun.mPosts.begin(), mRun.mPosts.end(), [&](const Queued& inOne) { return inOne.mNumber == inPost; });
    const std::size_t at = static_cast<std::size_t>(post - mRun.mPosts.begin());
    if (post == mRun.mPosts.end()) return Fail("post " + std::to_string(inPost) + " delivered: cancelled, replaced, dropped or not due");
    if (at < mRun.mAt) return Fail("post " + std::to_string(inPost) + " delivered after a later one");
    mRun.mAt = at, ++mRun.mHeard[at * kSlots + inSlot];
    Note(" <%d>%d", inSlot, inPost);
    if (mLevels.empty() && mMain && Pick(8) == 0) Terminate();
  }
  void OnDestroyed(int inSlot) { inSlot == kGone ? Fatal("a subscription's handler was destroyed while it ran") : void(mObjects[inSlot].mDestroyed = true); }
  void OnStation(int inNode, Tarn::Station* inStation) {
    const Node& node = mNodes[inNode];
    // Inside the library, after the last handler it called, the model has yet to walk the rest of the innermost
    // broadcast (and the utilities' release at its end): a station may go only if nobody else is to be called.
    // A relay retired meanwhile goes as its own outermost broadcast ends, while the walk that reached it goes on:
    // fine if the model, walking on to the next call, has left every frame of this station behind.
    if (inStation == nullptr) {
      const bool walk = mStale && mFailure.empty();
      const Snapshot before = walk ? Save() : Snapshot();
      const bool more = walk && Next() >= 0;
      if (node.mFrames > 0) Fatal("a station was deleted while a broadcast on it runs");
      if (more) Restore(before);
      if (node.mMade && !node.mDoomed) Fail("a station was deleted that the registry should keep");
    }
    if (inStation != nullptr && mStations[inNode] != nullptr) Fail("two stations of one ID alive");
    mStations[inNode] = inStation;
  }
  Tarn::Station* Factory(const ImmutableString& inStationID) {
    const int node = static_cast<int>(std::find(mIDs + 1, mIDs + kNodes, inStationID) - mIDs);
    return node < kNodes ? new TrackedStation(inStationID, node) : nullptr;
  }

private:
  int Pick(int inBound) { return static_cast<int>(mChoices.Below(static_cast<std::uint32_t>(inBound))); }
  template <class... Args>
  void Note(const char* inFormat, Args... inArgs) {
    char text[48];
    std::snprintf(text, sizeof text, inFormat, inArgs..., 0);  // the 0 keeps every call's arguments non-empty
    mTrace += text;
  }

  // The idle station is registered first, with the factory that reports station lives; the library's own
  // registration of it then changes nothing.
  void Initialize() {
    Registry::RegisterStation(Tarn::kStation_Idle, &MakeTracked);
    Tarn::Messaging::Initialize();
    mMain = mNodes[kIdle].mRegistered = true;
  }

  // Runs inCall on a helper thread while this thread waits, or here. Here, the library call meets the allocation
  // failure its operation drew, if any (the heap's or small-block storage's n-th allocation): the call throws
  // std::bad_alloc and leaves the library as it was (Act then restores the model), or returns having done it all.
  template <class Call>
  void OnThread(bool inHelper, Call inCall) {
    if (inHelper) {
      auto done = std::async(std::launch::async, inCall);
      if (done.wait_for(std::chrono::seconds(20)) != std::future_status::ready)
        std::fprintf(stderr, "operations harness: a helper operation hangs%s\n", mTrace.c_str()), std::abort();
      return done.get();
    }
    const int failAt = std::exchange(mFailAt, -1);
    if (failAt < 0) return inCall();
    failAt < kFailPoints ? messaging_test::FailHeapAfter(failAt) : SmallBlockAllocator::SetFailAfter(failAt - kFailPoints);
    try {
      inCall();
    } catch (const std::bad_alloc&) {
      mThrew = true;
    }
    messaging_test::FailHeapAfter(-1), SmallBlockAllocator::SetFailAfter(-1);
    ++sStatistics.mFailingCalls, sStatistics.mThrown += mThrew;
    Note(mThrew ? " (bad_alloc at %d)" : " (done despite %d)", failAt);
  }

  // One operation, from the top (inLevel 0) or from the handler of slot inCalled; a quarter of them with an
  // allocation failure.
  void Act(int inLevel, int inCalled = -1) {
    // Low slots, and in a handler its own slot, come more often, so that operations meet on the same listener.
    const int slot = inCalled >= 0 && Pick(3) == 0 ? inCalled : std::min(Pick(kSlots), Pick(kSlots));
    const int node = Pick(kNodes), op = Pick(16), choice = Pick(8);
    const bool helper = mMain && Pick(4) == 0;
    const int failAt = Pick(4) == 0 ? Pick(2 * kFailPoints) : -1;
    Snapshot before = failAt >= 0 ? Save() : Snapshot();
    mFailAt = failAt;
    [&] {
      switch (op) {
        case 0: return Create(slot, node);
        case 1: case 2: case 3: return AddOrRemove(slot, node, op != 3, choice, helper);
        case 4: return Kill(slot, helper);
        case 5: return Listen(slot, choice < 5);
        case 6: return SetBroadcasting(node, choice < 5);
        case 7: case 8: return inLevel < kMaxLevels ? Broadcast(node) : void();
        case 9: return Relay(node, choice % kIdle, choice < 5);
        case 10: case 11: return RegistryOp(node, choice % 5, helper);
        case 12: return mMain ? TimerOp(choice) : Revive(inLevel, choice);
        // Not to the idle station: any broadcast there runs the idle-time posts first.
        case 13: return mMain ? Post(1 + node % 3, choice % 4, helper) : void();
        case 14: return !mMain ? void() : choice < 5 ? Flush() : Cancel(choice % 2, helper);
        default: return !mMain ? Revive(inLevel, choice) : inLevel > 0 ? Terminate() : TimerOp(choice);  // mostly from handlers
      }
    }();
    mFailAt = -1;
    if (!std::exchange(mThrew, false)) return;
    // A station the failed call made stays, as a registered station made by a lookup would.
    for (int made = 1; made < kNodes; ++made) before.mNodes[made].mMade |= mStations[made] != nullptr;
    Restore(before);
  }

  // After a Terminate from a handler: the library initialized again here, or on another thread that, as the main
  // thread, operates (broadcasts too) while this one waits in its handler, and terminates the library again.
  void Revive(int inLevel, int inChoice) {
    // A station of the old life still broadcasting would meet its successor; the model keeps one per ID.
    for (int node = 1; node < kNodes; ++node)
      if (mNodes[node].mFrames > 0) return;
    if (inChoice < 4) return Note(" init"), Initialize();
    Note(" elsewhere{"), ++sStatistics.mMoves;
    OnThread(true, [&] {
      Initialize();
      for (int action = Pick(3); action >= 0 && mFailure.empty(); --action) Act(inLevel);
      if (mMain) Terminate();
    });
    Note("}");
  }

  void Create(int inSlot, int inNode) {
    Object& object = mObjects[inSlot];
    Handles& handles = mHandles[inSlot];
    if (object.mAlive) return;
    for (Node& node : mNodes)
      for (Entry& entry : node.mEntries) entry.mWho = entry.mWho == inSlot ? kGone : entry.mWho;
    object = Object(), handles.mListener = nullptr;
    object.mKind = Pick(5);
    object.mOwned = object.mAlive = true;
    Note(" new%d.%d", inSlot, object.mKind);
    switch (object.mKind) {
      case kPlain: handles.mListener = (handles.mPlain = std::make_unique<PlainProbe>(inSlot)).get(); break;
      case kBoost: handles.mListener = (handles.mBoost = boost::make_shared<PlainProbe>(inSlot)).get(); break;
      case kStd: handles.mListener = (handles.mStd = std::make_shared<PlainProbe>(inSlot)).get(); break;
      case kSafe: handles.mSafe = Tarn::ISafeListenerRef(new Probe<Tarn::SafeListenerBase>(inSlot)); break;
      default: Subscribe(inSlot, inNode == kIdle ? 0 : inNode);  // idle messages are not pings
    }
  }

  // A subscription is made attached, and gone at once when its station ID is not registered.
  void Subscribe(int inSlot, int inNode) {
    Note("@%d", inNode);
    Model(inNode, inSlot, kSub, true, true);
    if (!Reach(inNode)) mObjects[inSlot].mOwned = false, Die(inSlot);
    Tarn::Registration& made = mHandles[inSlot].mAttached[0][0];
    OnThread(false, [&] { made = inNode == 0 ? Tarn::Subscribe<Ping>(mB0, Handler(inSlot)) : Tarn::Subscribe<Ping>(mIDs[inNode], Handler(inSlot)); });
  }

  // Added or removed by the broadcaster's or the utilities' call, or by a registration of Tarn::Attach: made, or
  // reset (which removes nothing once the station it was made in is gone).
  void AddOrRemove(int inSlot, int inNode, bool inAdd, int inChoice, bool inHelper) {
    Object& object = mObjects[inSlot];
    if (!object.mOwned || object.mKind == kSub) return;
    // Objects owned by a shared pointer are sometimes registered by plain pointer: a second entry.
    const int way = (object.mKind == kBoost || object.mKind == kStd) && inChoice < 3 ? kPlain : object.mKind;
    Tarn::Registration& attached = mHandles[inSlot].mAttached[inNode][way != kPlain];
    int& life = mHandles[inSlot].mLife[inNode][way != kPlain];
    const bool registration = Pick(3) == 0 && (inAdd || attached);
    // A worker's removal of a listener the main thread is delivering to waits for that delivery, and here the
    // main thread waits for the worker.
    if (!inAdd && inHelper && Delivering(inSlot, way)) return;
    // Only the harness's broadcaster, which never dies, is left a back-link by a removal that does not unlink.
    const bool unlink = registration || inNode != 0 || inChoice < 6;
    Note(inAdd ? " add%d.%d@%d" : " rm%d.%d@%d", inSlot, way, inNode);
    Note(registration ? "(attach)%s" : unlink ? "%s" : "(keep link)%s", inHelper ? "h" : "");
    if (inAdd || !registration || life == mLives[inNode]) Model(inNode, inSlot, way, inAdd, unlink);
    OnThread(inHelper, [&] {
      if (registration && !inAdd) return attached.Reset();
      WithListener(mHandles[inSlot], way, [&](const auto& inListener) {
        if (!registration) return Call(inNode, inAdd, unlink, inListener);
        Tarn::Registration made = inNode == 0 ? Tarn::Attach(mB0, inListener) : Tarn::Attach(mIDs[inNode], inListener);
        // The earlier registration is given up, not reset: it would remove the entry just made.
        attached.Release(), attached = std::move(made), life = mLives[inNode];
      });
    });
  }

  template <class Use>
  static void WithListener(Handles& ioObject, int inWay, Use inUse) {
    switch (inWay) {
      case kPlain: return inUse(ioObject.mListener);
      case kBoost: return inUse(boost::weak_ptr<Tarn::Listener>(ioObject.mBoost));
      case kStd: return inUse(std::weak_ptr<Tarn::Listener>(ioObject.mStd));
      default: return inUse(ioObject.mSafe);
    }
  }

  template <class L>
  void Call(int inNode, bool inAdd, bool inUnlink, const L& inListener) {
    if (inAdd) return inNode == 0 ? mB0.AddListener(inListener) : Utils::AddListener(mIDs[inNode], inListener);
    if (inNode != 0) return Utils::RemoveListener(mIDs[inNode], inListener);
    if constexpr (std::is_same_v<L, Tarn::Listener*>) mB0.RemoveListener(inListener, inUnlink);
    else mB0.RemoveListener(inListener);
  }

  void Kill(int inSlot, bool inHelper) {
    Object& object = mObjects[inSlot];
    // Destroying a listener while a plain delivery to it runs is the owner's fault, not the library's. A
    // subscription reset on a worker waits for its delivery on the main thread, while here the main thread waits.
    const bool sub = object.mKind == kSub;
    if (!object.mOwned || Delivering(inSlot, sub ? (inHelper ? kSub : -1) : kPlain)) return;
    Note(inHelper ? " kill%dh" : " kill%d", inSlot);
    object.mOwned = false;
    // A subscription is detached at once, and its handler destroyed once no call of it runs.
    for (Node& node : mNodes) Erase(node.mEntries, [&](const Entry& inEntry) { return sub && inEntry.mWho == inSlot; });
    if (object.mHolds == 0) Die(inSlot);
    Handles& handles = mHandles[inSlot];
    // Given up first: a plain listener detaches itself as it dies, a weak or safe entry stays for a broadcast to prune.
    for (auto& attached : handles.mAttached) sub ? void() : (attached[0].Release(), attached[1].Release());
    OnThread(inHelper, [&] {
      handles.mAttached[0][0].Reset(), handles.mPlain.reset(), handles.mBoost.reset(), handles.mStd.reset(), handles.mSafe = nullptr;
    });
  }

  void Listen(int inSlot, bool inOn) {
    Tarn::Listener* listener = mHandles[inSlot].mListener;
    if (!mObjects[inSlot].mOwned || listener == nullptr) return;
    Note(inOn ? " listen%d" : " deaf%d", inSlot);
    mObjects[inSlot].mListening = inOn;
    inOn ? listener->StartListening() : listener->StopListening();
  }

  void SetBroadcasting(int inNode, bool inOn) {
    Note(inOn ? " start@%d" : " stop@%d", inNode);
    if (Reach(inNode)) mNodes[inNode].mBroadcasting = inOn;
    if (inNode == 0) return inOn ? mB0.StartBroadcasting() : mB0.StopBroadcasting();
    inOn ? Utils::StartBroadcasting(mIDs[inNode]) : Utils::StopBroadcasting(mIDs[inNode]);
  }

  void Broadcast(int inNode) {
    Note(" bc@%d{", inNode);
    // The utilities retain the station for the length of the broadcast.
    const bool retained = inNode != 0 && Reach(inNode);
    if (retained) ++mNodes[inNode].mRetains;
    mLevels.push_back(Level{mFrames.size(), retained ? inNode : 0});
    const bool delivers = mMain && (inNode == 0 || retained) && mNodes[inNode].mBroadcasting;
    if (delivers) Push(inNode);
    const bool stale = std::exchange(mStale, true);
    if (inNode == 0) mB0.BroadcastMessage(Ping());
    else if (inNode != kIdle) Utils::BroadcastMessage(mIDs[inNode], Ping());
    // The idle-time posts waiting are delivered first; those its handlers make wait for the next.
    else RunPosts(delivers ? &mPosts[1] : nullptr, [] { Utils::BroadcastMessage(Tarn::kStation_Idle, Tarn::ApplicationIdleMessage()); });
    mStale = stale;
    const int missed = mFailure.empty() ? Next() : -1;
    if (missed >= 0) Fail("a broadcast ended without calling slot " + std::to_string(missed));
    mLevels.pop_back();
    Note("}%d", inNode);
  }

  // Station inNode (1-3) attached to or detached from inParent, a lower node: chains, no cycles.
  void Relay(int inNode, int inParent, bool inAttach) {
    if (inNode == 0 || inNode == kIdle || !mMain || !mNodes[inNode].mRegistered) return;
    inParent %= inNode;
    Note(inAttach ? " relay%d@%d" : " unrelay%d@%d", inNode, inParent);
    Reach(inNode);
    Tarn::Listener* station = Registry::FindStation(mIDs[inNode]);
    if (station == nullptr || station != mStations[inNode]) return Fail("FindStation returned another station");
    Model(inParent, kSlots + inNode, kPlain, inAttach, true);
    Call(inParent, inAttach, true, station);
  }

  void RegistryOp(int inNode, int inOp, bool inHelper) {
    if (inNode == 0 || inNode == kIdle || !mMain) return;
    Node& node = mNodes[inNode];
    const ImmutableString& id = mIDs[inNode];
    Tarn::Station* got = nullptr;
    if (inOp == 0) {  // an ID is registered again only once its last station is gone
      if (node.mRegistered || node.mMade) return;
      node.mRegistered = true;
    } else if (inOp == 1 || inOp == 2) {
      if (Reach(inNode) && inOp == 1) ++node.mRetains, ++node.mHeld;
    } else if (inOp == 3) {
      if (node.mHeld == 0) return;  // only what was retained is released
      const bool last = node.mRetains == 1 && node.mDisposeRequested;
      // A worker's last release deletes the station, which waits for the relay delivery the main thread is in.
      if (last && inHelper && node.mFrames > 0) return;
      --node.mHeld, --node.mRetains;
      if (last) Doom(inNode);
    } else if (node.mRegistered && node.mRetains > 0) {
      node.mDisposeRequested = true;
    } else if (node.mRegistered) {
      Doom(inNode);
    }
    static const char* const kNames[] = {" register@%d", " retain@%d", " find@%d", " release@%d", " dispose@%d"};
    Note(kNames[inOp], inNode), Note(inHelper ? "h" : "");
    OnThread(inHelper, [&] {
      switch (inOp) {
        case 0: return Registry::RegisterStation(id, &MakeTracked);
        case 1: case 2: got = inOp == 1 ? Registry::RetainStation(id) : Registry::FindStation(id); return;
        case 3: return Registry::ReleaseStation(id);
        default: return Registry::DisposeStation(id);
      }
    });
    if (!mThrew && got != ((inOp == 1 || inOp == 2) && node.mRegistered ? mStations[inNode] : nullptr)) Fail("the registry returned another station");
    if (inHelper) Flush();
    Settle();
  }

  void TimerOp(int inChoice) {
    if (!mMain || inChoice == 0) return mMain ? Terminate() : void();
    if (!mTimer) {
      Note(" timer"), OnThread(false, [&] { mTimer = std::make_unique<Tarn::IdleCountdownTimer>(); });
    } else if (inChoice < 5) {
      // Duration 0: it fires at the first idle message that reaches it.
      Note(" arm");
      if (!mTimerListening && Reach(kIdle)) mNodes[kIdle].mEntries.push_back(Entry{mToken++, kTimer, kPlain});
      mTimerListening = mTimerListening || Reach(kIdle);
      OnThread(false, [&] { mTimer->ArmTimer(); });
    } else {
      DestroyTimer();
    }
  }

  // Its destructor disposes of its station on the main thread, which also deletes stations disposed of on workers.
  void DestroyTimer() {
    if (!mTimer) return;
    Note(" ~timer");
    if (std::exchange(mTimerListening, false)) Model(kIdle, kTimer, kPlain, false, true);
    mTimer.reset(), Settle();
  }

  // Posts: plain (inKind 0), coalesced (1) under the type's key or a caller key, cancellable (2) under one of two
  // tokens, and idle-time (3), to a station. A coalesced post takes the place of one waiting under the same key.
  void Post(int inNode, int inKind, bool inHelper) {
    static const char* const kKinds[] = {" post%d@%d", " coalesce%d@%d", " cancellable%d@%d", " idle%d@%d"};
    const int number = mPostNumber++, key = inKind == 2 ? Pick(2) : inKind == 1 ? Pick(3) - 1 : 0;
    Note(kKinds[inKind], number, inNode), Note(inHelper ? "h#%d" : "#%d", key);
    std::vector<Queued>& queue = mPosts[inKind == 3];
    const auto same = std::find_if(queue.begin(), queue.end(), [&](const Queued& inPost) { return inKind == 1 && inPost.mKind == 1 && inPost.mNode == inNode && inPost.mKey == key; });
    if (same != queue.end()) same->mNumber = number;
    else if (inKind != 2 || !mCancelled[key]) queue.push_back(Queued{number, inNode, inKind, key});
    OnThread(inHelper, [&] {
      const ImmutableString& id = mIDs[inNode];
      switch (inKind) {
        case 0: return Utils::PostMessageToUIThread(id, Posted(number), true);
        case 1: return key < 0 ? Utils::PostCoalescedMessageToUIThread(id, Posted(number)) : Utils::PostCoalescedMessageToUIThread(id, Posted(number), key);
        case 2: return Utils::PostMessageToUIThread(id, Posted(number), mTokens[key]);
        default: return Utils::PostMessageAtIdleTime(id, Posted(number));
      }
    });
  }

  // A token cancelled drops its posts, and every later one; now and then it is replaced by a new token.
  void Cancel(int inToken, bool inHelper) {
    Note(inHelper ? " cancel#%dh" : " cancel#%d", inToken);
    mPosts[0].erase(std::remove_if(mPosts[0].begin(), mPosts[0].end(), [&](const Queued& inPost) { return inPost.mKind == 2 && inPost.mKey == inToken; }), mPosts[0].end());
    mCancelled[inToken] = true;
    OnThread(inHelper, [&] { mTokens[inToken].Cancel(); });
    // Not after a cancel that threw: the model goes back to before it, and a new token would not.
    if (!mThrew && Pick(2) == 0) mTokens[inToken] = Tarn::PostCancelToken(), mCancelled[inToken] = false;
  }

  // What a main thread does for workers: runs the pending calls (the posts), deletes the stations they disposed of.
  void Flush() {
    Note(" flush");
    RunPosts(&mPosts[0], [this] { Utils::FlushPostedMessagesOnUIThread(), mMain ? Drain() : void(); });
  }

  // inRun delivers the posts of ioDue (none if null), in order: each to every listener of its station, and of the
  // stations relaying it, as the model has them now, unless a Terminate drops them.
  template <class Deliver>
  void RunPosts(std::vector<Queued>* ioDue, Deliver inRun) {
    PostRun run;
    if (ioDue != nullptr) run.mPosts = std::exchange(*ioDue, {});
    for (const Queued& post : run.mPosts)
      for (int slot = 0; slot < kSlots; ++slot) run.mExpected.push_back(Count(post.mNode, slot));
    run.mHeard.assign(run.mExpected.size(), 0);
    const PostRun outer = std::exchange(mRun, run);
    inRun();
    for (std::size_t at = 0; at < mRun.mHeard.size() && !mRun.mTerminated && mFailure.empty(); ++at)
      if (mRun.mHeard[at] != mRun.mExpected[at])
        Fail("post " + std::to_string(mRun.mPosts[at / kSlots].mNumber) + " heard " + std::to_string(mRun.mHeard[at]) + " times by slot " + std::to_string(at % kSlots) + "; the model expects " + std::to_string(mRun.mExpected[at]));
    mRun = outer;
  }

  // How often a broadcast on inNode now reaches inSlot with a post (subscriptions take pings only). A relay
  // relays while it lives, registered or not.
  int Count(int inNode, int inSlot, bool inRelay = false) {
    if (!mMain || !(inRelay || Reach(inNode)) || !mNodes[inNode].mBroadcasting) return 0;
    int count = 0;
    for (const Entry& entry : mNodes[inNode].mEntries) {
      const Object& object = mObjects[inSlot];
      if (entry.mWho == inSlot) count += entry.mWay == kPlain ? object.mListening : entry.mWay != kSub && object.mAlive;
      if (entry.mWho >= kSlots && entry.mWho < kTimer) count += Count(entry.mWho - kSlots, inSlot, true);
    }
    return count;
  }

  void Terminate() {
    DestroyTimer();
    Note(" terminate");
    mPosts[0].clear(), mPosts[1].clear(), mRun.mTerminated = true;
    for (int node = 1; node < kNodes; ++node) Doom(node);
    mMain = false, Tarn::Messaging::Terminate(), Settle();
  }

  // --- the model

  // Whether the utilities reach the node (a registered station is made by the lookup if it was not yet).
  bool Reach(int inNode) { return inNode == 0 || (mNodes[inNode].mRegistered && (mNodes[inNode].mMade = true)); }

  bool HasEntry(int inNode, int inWho, int inWay) const {
    const std::vector<Entry>& entries = mNodes[inNode].mEntries;
    return std::any_of(entries.begin(), entries.end(),
                       [&](const Entry& inEntry) { return inEntry.mWho == inWho && inEntry.mWay == inWay; });
  }

  void Model(int inNode, int inWho, int inWay, bool inAdd, bool inUnlink) {
    if (!Reach(inNode)) return;  // the utilities do nothing for an ID that is not registered
    std::vector<Entry>& entries = mNodes[inNode].mEntries;
    const bool plainSlot = inWho < kSlots && inWay == kPlain;
    if (inAdd && !HasEntry(inNode, inWho, inWay)) {
      entries.push_back(Entry{mToken++, inWho, inWay});
      if (plainSlot) ++mObjects[inWho].mLinks[inNode];
    }
    if (!inAdd) Erase(entries, [&](const Entry& inEntry) { return inEntry.mWho == inWho && inEntry.mWay == inWay; });
    if (!inAdd && inUnlink && plainSlot) mObjects[inWho].mLinks[inNode] = 0;
  }

  template <class Predicate>
  static void Erase(std::vector<Entry>& ioEntries, Predicate inWhich) {
    ioEntries.erase(std::remove_if(ioEntries.begin(), ioEntries.end(), inWhich), ioEntries.end());
  }

  // The object's plain registrations go with it; weak and safe ones stay until a broadcast prunes them.
  void Die(int inSlot) {
    mObjects[inSlot].mAlive = false;
    for (int node = 0; node < kNodes; ++node)
      mObjects[inSlot].mLinks[node] = 0, Erase(mNodes[node].mEntries, [&](const Entry& inEntry) { return inEntry.mWho == inSlot && (inEntry.mWay == kPlain || inEntry.mWay == kSub); });
  }

  void Doom(int inNode) {
    Node& node = mNodes[inNode];
    node.mRegistered = node.mDisposeRequested = false, node.mRetains = node.mHeld = 0, node.mDoomed = node.mMade;
  }

  // Doomed stations go once no broadcast on them runs (after a worker's operation, once the main thread drained).
  void Settle() {
    for (int node = 1; node < kNodes; ++node)
      if (mNodes[node].mDoomed && mNodes[node].mFrames == 0) Delete(node);
  }

  // A station deleted: it leaves the broadcasters it relays, its listeners lose it.
  void Delete(int inNode) {
    mNodes[inNode] = Node(), ++mLives[inNode];
    for (Object& object : mObjects) object.mLinks[inNode] = 0;
    for (Node& node : mNodes) Erase(node.mEntries, [&](const Entry& inEntry) { return inEntry.mWho == kSlots + inNode; });
  }

  void Push(int inNode) { mFrames.push_back(Frame{inNode, mToken}), ++mNodes[inNode].mFrames; }

  // The slot that the innermost broadcast begun by the harness calls next, or -1 when it is done;
  // walks relays, the timer, stopped listeners and dead weak entries (which it prunes) on the way.
  int Next() {
    while (mFrames.size() > mLevels.back().mBase) {
      Frame& frame = mFrames.back();
      Object& held = mObjects[std::max(frame.mWho, 0)];
      if (frame.mWho >= 0 && frame.mWay != kPlain && --held.mHolds == 0 && !held.mOwned && held.mAlive) Die(frame.mWho);
      frame.mWho = -1;
      std::vector<Entry>& entries = mNodes[frame.mNode].mEntries;
      auto next = entries.end();
      for (auto entry = entries.begin(); entry != entries.end(); ++entry)
        if (entry->mToken < frame.mLast && (next == entries.end() || entry->mToken > next->mToken)) next = entry;
      if (next == entries.end()) {
        const int node = frame.mNode;
        mFrames.pop_back();
        if (--mNodes[node].mFrames == 0 && mNodes[node].mDoomed) Delete(node);
        continue;
      }
      frame.mLast = next->mToken;
      const int who = next->mWho, way = next->mWay;
      if (who == kGone || who == kTimer) {  // the timer fires: it leaves the idle station, broadcasts on its own
        entries.erase(next);
        mTimerListening = mTimerListening && who != kTimer;
      } else if (who >= kSlots) {
        if (mMain && mNodes[who - kSlots].mBroadcasting) Push(who - kSlots);
      } else if (way == kPlain ? mObjects[who].mListening : mObjects[who].mAlive) {
        frame.mWho = who, frame.mWay = way, mObjects[who].mHolds += way != kPlain;
        return who;
      } else if (way != kPlain) {
        entries.erase(next);
      }
    }
    // Done: the utilities release the station they retained.
    const int released = std::exchange(mLevels.back().mRetained, 0);
    Node& node = mNodes[released];
    if (released != 0 && node.mRegistered && --node.mRetains == 0 && node.mDisposeRequested) Doom(released);
    Settle();
    return -1;
  }

  bool Delivering(int inSlot, int inWay) const {
    return std::any_of(mFrames.begin(), mFrames.end(),
                       [&](const Frame& inFrame) { return inFrame.mWho == inSlot && inFrame.mWay == inWay; });
  }

  // What the library answers between steps, against the model.
  void Compare() {
    if (!mFailure.empty()) return;
    if (mB0.HasListeners() != !mNodes[0].mEntries.empty()) Fail("HasListeners disagrees with the model");
    for (int node = 1; node < kNodes; ++node)
      if ((mStations[node] != nullptr) != mNodes[node].mMade) Fail("station " + std::to_string(node) + " lives against the model");
    for (int slot = 0; slot < kSlots; ++slot) {
      Object& object = mObjects[slot];
      if (object.mKind >= 0 && object.mDestroyed == object.mAlive) Fail("slot " + std::to_string(slot) + " lives against the model");
      Tarn::Listener* listener = mHandles[slot].mListener;
      for (int node = 0; node < kNodes && object.mOwned && listener != nullptr; ++node) {
        Tarn::Broadcaster* broadcaster = node == 0 ? &mB0 : mStations[node];
        if (broadcaster != nullptr && (broadcaster->HasListener(listener) != HasEntry(node, slot, kPlain) ||
                                       listener->HasBroadcaster(broadcaster) != (object.mLinks[node] > 0)))
          Fail("registration or back-link of slot " + std::to_string(slot) + " at " + std::to_string(node));
      }
    }
  }

  Choices& mChoices;
  std::string mFailure, mTrace;
  kivcore::config::ErrorHandler mPreviousErrors;
  kivcore::config::ErrorManager::ExceptionHandler mPreviousExceptions;
  ImmutableString mIDs[kNodes];
  Tarn::Station* mStations[kNodes] = {};  // as the stations report their lives
  Node mNodes[kNodes];
  Object mObjects[kSlots];
  std::vector<Frame> mFrames;
  // Per broadcast begun by the harness: its first frame, and the station the utilities retained for it until they
  // release it (0: none).
  struct Level { std::size_t mBase; int mRetained; };
  std::vector<Level> mLevels;  // per broadcast begun by the harness
  int mLives[kNodes] = {};  // stations of the node deleted so far
  std::vector<Queued> mPosts[2];  // waiting for the next run of pending calls, and for the next idle broadcast
  // The run of posts in progress: the posts, the one delivered last, and per post and slot the calls heard and due.
  struct PostRun {
    std::vector<Queued> mPosts;
    std::size_t mAt = 0;
    std::vector<int> mHeard, mExpected;
    bool mTerminated = false;
  } mRun;
  int mPostNumber = 1;
  Tarn::PostCancelToken mTokens[2];
  bool mCancelled[2] = {};
  // The model, as an operation whose call throws std::bad_alloc must leave it.
  struct Snapshot {
    std::vector<Node> mNodes;
    std::vector<Object> mObjects;
    std::vector<Frame> mFrames;
    std::vector<Level> mLevels;
    std::vector<int> mLives;
    bool mTimerListening = false;
    std::vector<Queued> mPosts[2];
    bool mCancelled[2] = {};
  };
  Snapshot Save() const {
    return Snapshot{{std::begin(mNodes), std::end(mNodes)}, {std::begin(mObjects), std::end(mObjects)}, mFrames, mLevels,
                    {std::begin(mLives), std::end(mLives)}, mTimerListening, {mPosts[0], mPosts[1]}, {mCancelled[0], mCancelled[1]}};
  }
  void Restore(const Snapshot& inSnapshot) {
    std::copy(inSnapshot.mNodes.begin(), inSnapshot.mNodes.end(), mNodes);
    std::copy(inSnapshot.mObjects.begin(), inSnapshot.mObjects.end(), mObjects);
    std::copy(inSnapshot.mLives.begin(), inSnapshot.mLives.end(), mLives);
    mFrames = inSnapshot.mFrames, mLevels = inSnapshot.mLevels, mTimerListening = inSnapshot.mTimerListening;
    mPosts[0] = inSnapshot.mPosts[0], mPosts[1] = inSnapshot.mPosts[1];
    std::copy(std::begin(inSnapshot.mCancelled), std::end(inSnapshot.mCancelled), mCancelled);
  }
  int mFailAt = -1;      // the allocation failure the current operation drew: see OnThread; -1: none
  bool mThrew = false;   // the current operation's library call threw std::bad_alloc
  Handles mHandles[kSlots];
  bool mStale = false;         // the library runs the innermost broadcast past the last call the model walked to
  int mToken = 1, mHandlerActions = 0;
  bool mMain = true, mTimerListening = false;  // mMain: the library is initialized (this thread is its main thread)
  std::unique_ptr<Tarn::IdleCountdownTimer> mTimer;
  Tarn::Broadcaster mB0;  // last: its listeners are gone before it
};

inline void Called(int inSlot, int inPost) { inPost > 0 ? sHarness->OnPosted(inSlot, inPost) : sHarness->OnCall(inSlot); }
inline void Destroyed(int inSlot) { sHarness != nullptr ? sHarness->OnDestroyed(inSlot) : void(); }
inline void StationLife(int inNode, Tarn::Station* inStation) {
  if (inNode >= 0 && sHarness != nullptr) sHarness->OnStation(inNode, inStation);
}
inline Tarn::Station* MakeTracked(const ImmutableString& inStationID) { return sHarness->Factory(inStationID); }

inline std::size_t BlocksInUse() { return kivcore::utility::SmallBlockAllocator::GetStatistics().blocksInUse; }

// One sequence of at most inSteps operations; returns the failure, or an empty string.
inline std::string RunSequence(Choices& ioChoices, int inSteps) {
  const std::size_t baseline = BlocksInUse();
  const std::string failure = Harness(ioChoices).Run(inSteps);
  return failure.empty() && BlocksInUse() != baseline ? "small blocks leaked" : failure;
}

// For RunConcurrent: a call after the listener's removal returned is a fault. A drainer deletes, from its handler,
// the stations workers let go, perhaps the relay it is called through.
// Destroyed on the worker while the main thread may be delivering to it, so it detaches while still whole, as the
// listener contract asks of such a class.
struct Watcher : Tarn::Listener {
  explicit Watcher(bool inDrains = false) : mDrains(inDrains) {}
  ~Watcher() override { DetachFromBroadcasters(); }
  void ListenToMessage(const Tarn::Message&) override { sLateCalls += mRemoved ? 1 : 0, ++mCalls, mDrains ? Drain() : void(); }
  std::atomic<bool> mRemoved{false};
  std::atomic<int> mCalls{0};
  const bool mDrains;
  static inline std::atomic<int> sLateCalls{0};
};

// Two workers tear down while the main thread broadcasts. Each round a worker makes a station, attaches it as a
// relay to a broadcaster the main thread broadcasts on, gives it the drainer and a listener (which also hears a
// well-known station), removes or destroys the listener, and lets the station go by disposal and last release, in
// either order. Meanwhile the main thread broadcasts on both, drains, and now and then disposes of the well-known
// station and registers it again. Then a worker adds, posts to and removes listeners of the well-known station while
// the main thread makes the last Terminate and initializes again, over and over. Returns the failure, or "".
inline std::string RunConcurrent(int inRounds, std::uint32_t inSeed) {
  const std::size_t baseline = BlocksInUse();
  const int lateCalls = Watcher::sLateCalls;
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(60);
  auto check = [&] { std::chrono::steady_clock::now() > deadline ? std::fprintf(stderr, "operations harness: a worker hangs\n"), std::abort() : void(); };
  std::string failure;
  Tarn::Messaging::Initialize();
  {
    Tarn::Broadcaster parent;
    Watcher drainer(true);
    std::atomic<int> working{2};
    auto tearDown = [&](std::uint32_t inWorkerSeed) {
      std::minstd_rand random(inWorkerSeed);
      for (int round = 0; round < inRounds; ++round) {
        const ImmutableString id = Registry::UniqueStationID();
        Registry::RegisterStation(id, &MakeCounted);
        Tarn::Station* station = Registry::RetainStation(id);
        parent.AddListener(station), station->AddListener(&drainer);
        auto watcher = std::make_unique<Watcher>();
        for (const ImmutableString* id : {&id, &Tarn::kStation_StatusBar}) Utils::AddListener(*id, watcher.get());
        if (random() % 2 == 0) {
          for (const ImmutableString* id : {&id, &Tarn::kStation_StatusBar}) Utils::RemoveListener(*id, watcher.get());
          watcher->mRemoved = true;
        }
        if (random() % 2 == 0) watcher.reset();  // destroyed while attached, or once removed
        // The last release deletes the station, or the main thread does once it was queued: while it may be relaying.
        random() % 2 == 0 ? (Registry::DisposeStation(id), Registry::ReleaseStation(id)) : (Registry::ReleaseStation(id), Registry::DisposeStation(id));
      }
      --working;
    };
    auto first = std::async(std::launch::async, tearDown, inSeed), second = std::async(std::launch::async, tearDown, inSeed + 1);
    for (int round = 0; working > 0; ++round, check()) {
      parent.BroadcastMessage(Ping());
      Utils::BroadcastMessage(Tarn::kStation_StatusBar, Ping());
      Drain();
      if (round % 16 == 0) Registry::DisposeStation(Tarn::kStation_StatusBar), Registry::RegisterStation(Tarn::kStation_StatusBar, nullptr);
    }
    first.get(), second.get();
    Drain();
    if (parent.HasListeners()) failure = "a deleted relay is still attached";
    if (drainer.mCalls == 0) failure = "no broadcast went through a relay";
  }
  std::atomic<bool> done{false};
  auto worker = std::async(std::launch::async, [&] {
    for (int round = 0; round < inRounds; ++round) {
      Watcher watcher;
      Utils::AddListener(Tarn::kStation_StatusBar, &watcher);
      Utils::PostMessageToUIThread(Tarn::kStation_StatusBar, Ping(), true);
      Utils::RemoveListener(Tarn::kStation_StatusBar, &watcher);
      watcher.mRemoved = true;
    }
    done = true;
  });
  for (; !done; check()) Utils::BroadcastMessage(Tarn::kStation_StatusBar, Ping()), Drain(), Tarn::Messaging::Terminate(), Tarn::Messaging::Initialize();
  worker.get();
  Tarn::Messaging::Terminate();
  if (Watcher::sLateCalls != lateCalls) return "a listener was called after its removal returned";
  if (sLiveStations != 0) return "stations outlived Terminate";
  return !failure.empty() ? failure : BlocksInUse() != baseline ? "small blocks leaked" : "";
}

}  // namespace operations_harness
