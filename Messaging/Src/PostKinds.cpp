// Coalesced, cancellable and idle-time posts, beside the plain post of
// StationUtils.cpp.
//
// Each kind keeps the copies it may still replace, drop or hold back in a
// store of its own, under a mutex of its own, and (except idle-time posts,
// which never enter the main thread's queue) queues a one-pointer-sized call
// that takes its copy out of the store when it runs. A copy taken out is
// gone from the store, so no later replacement or cancel reaches a delivery
// that has begun, and no copy can be delivered twice. The plain post path
// neither sees these stores nor takes their locks.
//
// Who frees what, and where:
// - a coalesced copy that a newer one replaces: the replacing poster, after
//   it has released the store's lock; the map entry: the last of its queued
//   calls, on the main thread, as its delivery begins, or a poster whose
//   queuing failed;
// - a cancellable copy: the main thread after its delivery, before the
//   delivery counts as ended; or the thread that calls Cancel, before Cancel
//   returns; a token's shared state: whichever of its token copies and
//   queued calls goes last;
// - an idle-time copy: the main thread after its delivery inside an idle
//   broadcast, or the thread of the last Terminate;
// - every kind, when queuing fails: the poster, before the exception leaves.
//
// The stores are never destroyed: the calls that refer to them may run
// during static destruction (a last Terminate made by a static object).
#include <TarnMessaging/Message.h>
#include <TarnMessaging/PostCancelToken.h>
#include <TarnMessaging/StationUtils.h>

#include "DiagnosticReports.h"
#include "PostKinds.h"

#include <kivcore/MainThread.h>

#include <boost/function.hpp>

#include <algorithm>
#include <condition_variable>
#include <cstdint>
#include <deque>
#include <iterator>
#include <map>
#include <mutex>
#include <tuple>
#include <utility>
#include <vector>

namespace Tarn {

using kivcore::utility::ImmutableString;
using PostedCall = boost::function<void()>;

// ---------------------------------------------------------------------------
// Cancellable posts

namespace Detail {

// The state a token's copies and its queued posts share.
struct PostCancelState {
  static const std::shared_ptr<PostCancelState>& Of(const PostCancelToken& inToken) noexcept { return inToken.mState; }

  std::mutex mMutex;
  std::condition_variable mDeliveryEnded;  // notified when mRunning drops to 0
  std::atomic<bool> mCancelled{false};     // set under mMutex, read without it
  int mRunning = 0;                        // deliveries under way; guarded by mMutex
  std::uint64_t mNextSerial = 0;           // guarded by mMutex
  // The undelivered copies, by ascending serial; guarded by mMutex.
  std::deque<std::pair<std::uint64_t, PostedCall>> mPending;
};

}  // namespace Detail

namespace {

using CancelState = Detail::PostCancelState;

// What the queue holds for a cancellable post. The copy stays with the token,
// so that Cancel can free it at once rather than when the queue gets here.
class CancellableCall {
public:
  CancellableCall(const std::shared_ptr<CancelState>& inState, std::uint64_t inSerial) noexcept
      : mState(inState), mSerial(inSerial) {}

  void operator()() const {
    CancelState& state = *mState;
    PostedCall call;
    {
      std::lock_guard<std::mutex> lock(state.mMutex);
      // Posts made on one thread run in serial order, so this is nearly
      // always the front; posts of several threads may be queued out of it.
      const auto entry = std::lower_bound(
          state.mPending.begin(), state.mPending.end(), mSerial,
          [](const std::pair<std::uint64_t, PostedCall>& inEntry, std::uint64_t inSerial) { return inEntry.first < inSerial; });
      // Gone: Cancel took and freed it.
      if (entry == state.mPending.end() || entry->first != mSerial) return;
      call.swap(entry->second);
      state.mPending.erase(entry);
      ++state.mRunning;
    }
    // The copy is freed before the delivery counts as ended, so that a Cancel
    // that waited for it leaves no copy of the token's posts behind.
    struct EndDelivery {
      CancelState& mState;
      PostedCall& mCall;
      ~EndDelivery() {
        mCall.clear();
        std::lock_guard<std::mutex> lock(mState.mMutex);
        if (--mState.mRunning == 0) mState.mDeliveryEnded.notify_all();
      }
    } end{state, call};
    call();
  }

private:
  std::shared_ptr<CancelState> mState;
  std::uint64_t mSerial;
};
static_assert(boost::detail::function::function_allows_small_object_optimization<CancellableCall>::value,
              "a cancellable call must fit inside boost::function");

}  // namespace

PostCancelToken::PostCancelToken() : mState(std::make_shared<CancelState>()) {}
PostCancelToken::~PostCancelToken() = default;
PostCancelToken::PostCancelToken(const PostCancelToken& inOther) noexcept = default;
PostCancelToken& PostCancelToken::operator=(const PostCancelToken& inOther) noexcept = default;

void PostCancelToken::Cancel() {
  CancelState& state = *mState;
  std::deque<std::pair<std::uint64_t, PostedCall>> dropped;
  {
    std::lock_guard<std::mutex> lock(state.mMutex);
    state.mCancelled.store(true, std::memory_order_release);
    dropped.swap(state.mPending);
  }
  // Message destructors are the host's code: never under our lock.
  dropped.clear();
  // A delivery running on the main thread while Cancel is called there is
  // one of Cancel's own callers; waiting for it would never end.
  if (kivcore::threads::CurrentThreadIsMainThread()) return;
  std::unique_lock<std::mutex> lock(state.mMutex);
  state.mDeliveryEnded.wait(lock, [&state] { return state.mRunning == 0; });
}

bool PostCancelToken::IsCancelled() const noexcept { return mState->mCancelled.load(std::memory_order_acquire); }

void StationUtils::PostMessageToUIThread(const ImmutableString& inStationID, const Message& inMessage,
                                         const PostCancelToken& inToken) {
  Diagnostics::Detail::ReportIfUnregistered(inStationID, TARN_CALL_SITE(), "Tarn::StationUtils::PostMessageToUIThread");
  const std::shared_ptr<CancelState>& state = CancelState::Of(inToken);
  if (state->mCancelled.load(std::memory_order_acquire)) return;
  // Declared before the lock, so that a copy dropped under it is freed after.
  PostedCall call = inMessage.CreateCallback(inStationID);
  std::uint64_t serial = 0;
  {
    std::lock_guard<std::mutex> lock(state->mMutex);
    if (state->mCancelled.load(std::memory_order_relaxed)) return;
    serial = state->mNextSerial++;
    state->mPending.emplace_back(serial, std::move(call));
  }
  try {
    kivcore::threads::AsyncCallFromMainThread(PostedCall(CancellableCall(state, serial)), 0);
  } catch (...) {
    // Not queued: nothing would ever take the copy out again.
    PostedCall lost;
    {
      std::lock_guard<std::mutex> lock(state->mMutex);
      for (auto entry = state->mPending.begin(); entry != state->mPending.end(); ++entry) {
        if (entry->first != serial) continue;
        lost.swap(entry->second);
        state->mPending.erase(entry);
        break;
      }
    }
    throw;
  }
}

// ---------------------------------------------------------------------------
// Coalesced posts

namespace {

enum class CoalesceBy : std::uint8_t { kMessageType, kCallerKey };

struct CoalescingKey {
  ImmutableString mStationID;
  std::uint64_t mKey;
  CoalesceBy mBy;

  bool operator<(const CoalescingKey& inOther) const noexcept {
    return std::tie(mStationID, mKey, mBy) < std::tie(inOther.mStationID, inOther.mKey, inOther.mBy);
  }
};

// A key's entry. A copy is put in only while a call for the entry is surely
// queued and has not run, so that every copy put in is delivered: a poster
// that finds no such call queues one first, and puts its copy in once the
// queue took the call. A poster whose queuing fails has put nothing in, so
// its failure touches no other post.
struct CoalescedEntry {
  PostedCall mCopy;  // the newest post; empty once a call took it
  // Calls for the entry queued and not yet run, or being queued; mUnsure
  // posters are queuing theirs (a call may run before its poster learns it
  // was queued). More than mUnsure: one is surely queued and has not run.
  std::uint32_t mPending = 0;
  std::uint32_t mUnsure = 0;
  bool HasSureCall() const noexcept { return mPending > mUnsure; }
};

// A key is in the map while a call for it is queued or being queued; the
// last of those erases it, so the iterator each call holds stays valid
// until it runs.
using CoalescedMap = std::map<CoalescingKey, CoalescedEntry>;

struct CoalescedPosts {
  std::mutex mMutex;
  CoalescedMap mQueued;  // guarded by mMutex
};

CoalescedPosts& Coalesced() {
  static CoalescedPosts* posts = new CoalescedPosts;
  return *posts;
}

// Erases an entry that no call will come for any more. mMutex held.
void EraseIfDone(CoalescedPosts& ioPosts, CoalescedMap::iterator inEntry) noexcept {
  if (inEntry->second.mPending == 0 && inEntry->second.mUnsure == 0) ioPosts.mQueued.erase(inEntry);
}

// What the queue holds for a coalesced post: its entry in the map, whose
// copy is whichever post came last before the call runs.
class CoalescedCall {
public:
  explicit CoalescedCall(CoalescedMap::iterator inEntry) noexcept : mEntry(inEntry) {}

  void operator()() const {
    CoalescedPosts& posts = Coalesced();
    PostedCall call;
    {
      std::lock_guard<std::mutex> lock(posts.mMutex);
      // From here on a post with this key is queued anew, behind this one
      // (a call still being queued for it is not sure yet). An empty copy:
      // an earlier call for the entry delivered it.
      call.swap(mEntry->second.mCopy);
      --mEntry->second.mPending;
      EraseIfDone(posts, mEntry);
    }
    if (!call.empty()) call();
  }

private:
  CoalescedMap::iterator mEntry;
};

void PostCoalesced(const CoalescingKey& inKey, const Message& inMessage) {
  // Holds the new copy, then the one it replaces, freed after the lock.
  PostedCall call = inMessage.CreateCallback(inKey.mStationID);
  CoalescedPosts& posts = Coalesced();
  std::unique_lock<std::mutex> lock(posts.mMutex);
  for (;;) {
    const CoalescedMap::iterator entry = posts.mQueued.try_emplace(inKey).first;
    if (entry->second.HasSureCall()) {
      entry->second.mCopy.swap(call);
      lock.unlock();
      return;
    }
    ++entry->second.mPending;
    ++entry->second.mUnsure;
    lock.unlock();
    try {
      kivcore::threads::AsyncCallFromMainThread(PostedCall(CoalescedCall(entry)), 0);
    } catch (...) {
      lock.lock();
      --entry->second.mUnsure;
      --entry->second.mPending;
      EraseIfDone(posts, entry);
      lock.unlock();
      throw;
    }
    lock.lock();
    --entry->second.mUnsure;
    // Next round: the copy goes in behind the call just queued, unless that
    // call has run already (it took nothing of this post); then another is
    // queued.
  }
}
constexpr const char* kCoalescedName = "Tarn::StationUtils::PostCoalescedMessageToUIThread";

}  // namespace

void StationUtils::PostCoalescedMessageToUIThread(const ImmutableString& inStationID, const Message& inMessage) {
  Diagnostics::Detail::ReportIfUnregistered(inStationID, TARN_CALL_SITE(), kCoalescedName);
  PostCoalesced(CoalescingKey{inStationID, inMessage.GetMessageID(), CoalesceBy::kMessageType}, inMessage);
}

void StationUtils::PostCoalescedMessageToUIThread(const ImmutableString& inStationID, const Message& inMessage,
                                                  std::uint64_t inCallerKey) {
  Diagnostics::Detail::ReportIfUnregistered(inStationID, TARN_CALL_SITE(), kCoalescedName);
  PostCoalesced(CoalescingKey{inStationID, inCallerKey, CoalesceBy::kCallerKey}, inMessage);
}

// ---------------------------------------------------------------------------
// Idle-time posts

std::atomic<bool> Detail::sIdlePostsWaiting{false};

namespace {

struct IdlePosts {
  std::mutex mMutex;
  std::vector<PostedCall> mWaiting;  // in the order posted; guarded by mMutex
  // The posts a run that threw did not reach, from mPutBackNext on: they
  // come before mWaiting. Guarded by mMutex.
  std::vector<PostedCall> mPutBack;
  std::size_t mPutBackNext = 0;
};

IdlePosts& Idle() {
  static IdlePosts* posts = new IdlePosts;
  return *posts;
}

// The posts one RunIdlePosts took, and how far it got. The vector stays in
// place while the run lives: a nested run only advances mNext.
struct IdleRun {
  std::vector<PostedCall> mPosts;
  std::size_t mNext = 0;
  bool mStopped = false;  // a post threw: the rest waits for the next idle broadcast
};

// The innermost idle run on this thread (the main thread). An idle broadcast
// from a handler of one of its posts finishes it first: its posts were made
// before any the nested broadcast could take.
thread_local IdleRun* tIdleRun = nullptr;

void RunRest(IdleRun& ioRun) {
  ioRun.mStopped = false;
  std::size_t running = 0;
  try {
    while (!ioRun.mStopped && ioRun.mNext < ioRun.mPosts.size()) {
      running = ioRun.mNext++;
      ioRun.mPosts[running]();
      ioRun.mPosts[running].clear();
    }
  } catch (...) {
    // The copy's destructor is the host's code: not under our lock later.
    ioRun.mPosts[running].clear();
    ioRun.mStopped = true;
    throw;
  }
}

}  // namespace

void StationUtils::PostMessageAtIdleTime(const ImmutableString& inStationID, const Message& inMessage) {
  Diagnostics::Detail::ReportIfUnregistered(inStationID, TARN_CALL_SITE(), "Tarn::StationUtils::PostMessageAtIdleTime");
  PostedCall call = inMessage.CreateCallback(inStationID);
  IdlePosts& posts = Idle();
  std::lock_guard<std::mutex> lock(posts.mMutex);
  posts.mWaiting.push_back(std::move(call));
  Detail::sIdlePostsWaiting.store(true, std::memory_order_relaxed);
}

void Detail::RunIdlePosts() {
  IdlePosts& posts = Idle();
  if (tIdleRun != nullptr) RunRest(*tIdleRun);
  IdleRun run;
  {
    std::lock_guard<std::mutex> lock(posts.mMutex);
    if (posts.mPutBackNext < posts.mPutBack.size()) {
      // Posts put back come first. When the newer ones cannot join them for
      // want of storage, this throws with both as they were (the delivered
      // posts dropped first hold nothing).
      if (!posts.mWaiting.empty()) {
        posts.mPutBack.erase(posts.mPutBack.begin(), posts.mPutBack.begin() + static_cast<std::ptrdiff_t>(posts.mPutBackNext));
        posts.mPutBackNext = 0;
        posts.mPutBack.insert(posts.mPutBack.end(), std::make_move_iterator(posts.mWaiting.begin()),
                              std::make_move_iterator(posts.mWaiting.end()));
        posts.mWaiting.clear();
      }
      run.mPosts.swap(posts.mPutBack);
      run.mNext = std::exchange(posts.mPutBackNext, 0);
    } else {
      run.mPosts.swap(posts.mWaiting);
    }
    sIdlePostsWaiting.store(false, std::memory_order_relaxed);
  }
  // When a post threw, hands the rest back whole, allocating nothing: no run
  // took posts since this one did, since a nested run first finishes this
  // one's posts and takes nothing when they throw.
  struct Finish {
    IdlePosts& mIdle;
    IdleRun& mRun;
    IdleRun* mOuter;
    ~Finish() {
      tIdleRun = mOuter;
      if (!mRun.mStopped || mRun.mNext == mRun.mPosts.size()) return;
      std::lock_guard<std::mutex> lock(mIdle.mMutex);
      mIdle.mPutBack.swap(mRun.mPosts);
      mIdle.mPutBackNext = mRun.mNext;
      sIdlePostsWaiting.store(true, std::memory_order_relaxed);
    }
  } finish{posts, run, tIdleRun};
  tIdleRun = &run;
  RunRest(run);
}

void Detail::DropIdlePosts() noexcept {
  IdlePosts& posts = Idle();
  std::vector<PostedCall> dropped;
  std::vector<PostedCall> putBack;
  std::lock_guard<std::mutex> lock(posts.mMutex);
  dropped.swap(posts.mWaiting);
  putBack.swap(posts.mPutBack);
  posts.mPutBackNext = 0;
  sIdlePostsWaiting.store(false, std::memory_order_relaxed);
}

}  // namespace Tarn
