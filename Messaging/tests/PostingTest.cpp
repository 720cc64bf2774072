// Bringing the library up and down and attaching while storage runs out, and posting
// afterwards.
//
// This executable replaces the global operator new so that a test can make
// the general heap fail after a given number of allocations, as the
// small-block allocator can, and count the bytes it holds (the library
// reaches the executable's operators).
#include "TestSupport.h"

#include <TarnMessaging.h>

#include <malloc.h>

#include <algorithm>
#include <new>
#include <stdexcept>
#include <typeinfo>

namespace {
// Allocations left before the heap fails, on every thread or on this one
// alone; negative: never fails. A thread's failure first runs its hook.
std::atomic<long long> gHeapAllocationsLeft{-1};
thread_local long long tHeapAllocationsLeft = -1;
thread_local std::function<void()>* tBeforeFailing = nullptr;
std::atomic<long long> gHeapBytes{0};  // held through operator new

void* Allocate(std::size_t inSize) {
  if (gHeapAllocationsLeft.load(std::memory_order_relaxed) >= 0 && gHeapAllocationsLeft.fetch_sub(1) <= 0)
    throw std::bad_alloc();
  if (tHeapAllocationsLeft >= 0 && tHeapAllocationsLeft-- == 0) {
    if (std::function<void()>* const hook = std::exchange(tBeforeFailing, nullptr)) (*hook)();
    throw std::bad_alloc();
  }
  void* const block = std::malloc(inSize == 0 ? 1 : inSize);
  if (block == nullptr) throw std::bad_alloc();
  gHeapBytes.fetch_add(static_cast<long long>(malloc_usable_size(block)), std::memory_order_relaxed);
  return block;
}
void Free(void* inBlock) noexcept {
  gHeapBytes.fetch_sub(static_cast<long long>(malloc_usable_size(inBlock)), std::memory_order_relaxed);
  std::free(inBlock);
}
}  // namespace

void* operator new(std::size_t inSize) { return Allocate(inSize); }
void* operator new[](std::size_t inSize) { return Allocate(inSize); }
void operator delete(void* inBlock) noexcept { Free(inBlock); }
void operator delete[](void* inBlock) noexcept { Free(inBlock); }
void operator delete(void* inBlock, std::size_t) noexcept { Free(inBlock); }
void operator delete[](void* inBlock, std::size_t) noexcept { Free(inBlock); }

namespace {

using namespace messaging_test;
using kivcore::utility::SmallBlockAllocator;
using Tarn::StationUtils::FlushPostedMessagesOnUIThread;
using Tarn::StationUtils::PostMessageToUIThread;
namespace Threads = kivcore::threads;

// Every allocation of Initialize and Terminate fails in turn, on the heap and
// in small-block storage: each call throws std::bad_alloc or succeeds, never
// hangs, and the library then comes up and delivers as usual.
TEST(PostingTest, InitializeAndTerminateSurviveEveryFailingAllocation) {
  Watchdog watchdog;
  auto failAfter = [](bool inHeap, long long inCount) { inHeap ? gHeapAllocationsLeft.store(inCount) : SmallBlockAllocator::SetFailAfter(inCount); };
  for (bool heap : {true, false}) {
    bool allSucceeded = false;
    for (long long n = 0; !allSucceeded && n < 1000; ++n) {
      allSucceeded = true;
      failAfter(heap, n);
      try {
        Tarn::Messaging::Initialize();
        try {
          Tarn::Messaging::Terminate();
        } catch (const std::bad_alloc&) {
          allSucceeded = false;
        }
      } catch (const std::bad_alloc&) {
        allSucceeded = false;
      }
      failAfter(heap, -1);

      Tarn::Messaging::Initialize();
      RecordingListener listener("l");
      Tarn::StationUtils::AddListener(Tarn::kStation_StatusBar, &listener);
      std::thread([] { PostMessageToUIThread(Tarn::kStation_StatusBar, PingMessage(), false); }).join();
      FlushPostedMessagesOnUIThread();
      EXPECT_EQ(1, listener.Calls()) << (heap ? "heap" : "small-block") << " failing after " << n;
      Tarn::StationUtils::RemoveListener(Tarn::kStation_StatusBar, &listener);
      Tarn::Messaging::Terminate();
    }
    EXPECT_TRUE(allSucceeded) << "the sweep never got past the failures";
  }
}

// Every form of Tarn::Attach, failing at each of its heap allocations in
// turn: one that throws std::bad_alloc leaves nothing attached. The record
// was once allocated after the listener was added, and its failure left a
// listener hearing every broadcast with no registration to detach it.
TEST(PostingTest, AnAttachThatRunsOutOfStorageLeavesNothingAttached) {
  MainThreadGuard mainThread;
  Tarn::Messaging::Initialize();
  Tarn::Broadcaster broadcaster;
  CallLog log;
  AnyListener listeners[] = {{ListenerKind::kPlainPointer, "plain", &log}, {ListenerKind::kBoostWeak, "boost", &log},
                             {ListenerKind::kStdWeak, "std", &log}, {ListenerKind::kSafe, "safe", &log}};
  auto heard = [&log] { return log.Entries().size(); };
  for (const bool onStation : {false, true}) {
    Tarn::Broadcaster& target = onStation ? *Tarn::StationRegistry::FindStation(Tarn::kStation_StatusBar) : broadcaster;
    for (AnyListener& listener : listeners) {
      for (long long n = 0; n < 100 && !HasFailure(); ++n) {
        SCOPED_TRACE(std::string(onStation ? "station" : "broadcaster") + " form " + std::to_string(&listener - listeners) +
                     ", failing after " + std::to_string(n));
        const std::size_t before = heard();
        try {
          gHeapAllocationsLeft.store(n);
          Tarn::Registration registration;
          listener.WithHandle([&](const auto& inHandle) {
            registration = onStation ? Tarn::Attach(Tarn::kStation_StatusBar, inHandle) : Tarn::Attach(broadcaster, inHandle);
          });
          gHeapAllocationsLeft.store(-1);
          target.BroadcastMessage(PingMessage());
          EXPECT_EQ(heard(), before + 1);
          break;
        } catch (const std::bad_alloc&) {
          gHeapAllocationsLeft.store(-1);
        }
        target.BroadcastMessage(PingMessage());
        EXPECT_EQ(heard(), before) << "a failed attach left its listener attached";
      }
    }
  }
  Tarn::Messaging::Terminate();
}

// Storage running out loses no post that stands. A queued call that throws
// once storage has run out: its exception propagates and the posts behind it
// (plain, coalesced and cancellable) stay queued, in order, and go out with
// the next run. Putting them back once took storage: they were destroyed
// unrun, std::bad_alloc replaced the exception, the coalesced key stayed
// blocked for ever and the cancellable copy stayed with its token. Then the
// same for idle-time posts, and a coalesced post that fails to queue its call.
TEST(PostingTest, StorageRunningOutLosesNoPostThatStands) {
  using Tarn::StationUtils::PostCoalescedMessageToUIThread;
  MainThreadGuard mainThread;
  Tarn::Messaging::Initialize();
  CallLog log;
  RecordingListener listener("l", &log);
  Tarn::StationUtils::AddListener(Tarn::kStation_StatusBar, &listener);
  const std::size_t blocksBefore = SmallBlockAllocator::GetStatistics().blocksInUse;
  const Tarn::PostCancelToken token;
  kivcore::threads::AsyncCallFromMainThread(
      [] {
        const std::runtime_error error("call");
        gHeapAllocationsLeft.store(0);
        throw error;
      },
      0);
  std::vector<std::string> expected;
  // More than any earlier run of this process left room for.
  for (int i = 0; i < 1000; ++i) {
    if (i == 1) PostCoalescedMessageToUIThread(Tarn::kStation_StatusBar, NumberMessage(i));
    else if (i == 2) PostMessageToUIThread(Tarn::kStation_StatusBar, NumberMessage(i), token);
    else PostMessageToUIThread(Tarn::kStation_StatusBar, NumberMessage(i), true);
    expected.push_back("l:" + std::to_string(i));
  }
  EXPECT_THROW(FlushPostedMessagesOnUIThread(), std::runtime_error);
  gHeapAllocationsLeft.store(-1);
  EXPECT_EQ(log.Entries().size(), 0u);
  FlushPostedMessagesOnUIThread();
  EXPECT_EQ(log.Entries(), expected);
  EXPECT_EQ(SmallBlockAllocator::GetStatistics().blocksInUse, blocksBefore) << "a copy outlived its delivery";
  PostCoalescedMessageToUIThread(Tarn::kStation_StatusBar, NumberMessage(1));
  FlushPostedMessagesOnUIThread();
  EXPECT_EQ(listener.Calls(), 1001) << "the coalesced key stayed blocked";
  // Idle-time posts behind one whose station's factory throws: the same.
  const kivcore::utility::ImmutableString failing = Tarn::StationRegistry::UniqueStationID();
  Tarn::StationRegistry::RegisterStation(failing, [](const kivcore::utility::ImmutableString& inID) -> Tarn::Station* {
    static bool sFailed = false;
    if (std::exchange(sFailed, true)) return new Tarn::Station(inID);
    const std::runtime_error error("factory");
    gHeapAllocationsLeft.store(0);
    throw error;
  });
  for (const auto& station : {failing, Tarn::kStation_StatusBar})
    Tarn::StationUtils::PostMessageAtIdleTime(station, NumberMessage(1001));
  Tarn::StationUtils::AddListener(Tarn::kStation_Idle, &listener);
  EXPECT_THROW(Tarn::StationUtils::BroadcastMessage(Tarn::kStation_Idle, PingMessage()), std::runtime_error);
  gHeapAllocationsLeft.store(-1);
  Tarn::StationUtils::BroadcastMessage(Tarn::kStation_Idle, PingMessage());
  // The idle listeners once missed the message the failure came with.
  const std::vector<std::string> entries = log.Entries();
  EXPECT_EQ(std::vector<std::string>(entries.begin() + std::min<std::ptrdiff_t>(1001, entries.size()), entries.end()),
            (std::vector<std::string>{"l:ping", "l:1001", "l:ping"}));
  Tarn::StationUtils::RemoveListener(Tarn::kStation_Idle, &listener);
  Tarn::StationRegistry::DisposeStation(failing);
  // Worker A's coalesced post fails to queue its call while worker B posts
  // with the same key: B's post, which returns normally, is delivered, and
  // A's, which throws, is not. A once erased the entry holding B's copy.
  std::thread([] {
    // Fills the queue to its capacity: the next call queued needs storage.
    for (bool full = false; !full;) {
      tHeapAllocationsLeft = 0;
      try {
        PostMessageToUIThread(Tarn::kStation_StatusBar, PingMessage(), true);
      } catch (const std::bad_alloc&) {
        full = true;
      }
    }
    std::thread b;
    std::atomic<bool> returned{false};
    std::function<void()> postOnB = [&] {
      b = std::thread([&] {
        PostCoalescedMessageToUIThread(Tarn::kStation_StatusBar, NumberMessage(2));
        returned = true;
      });
      // Fixed, B's post needs the queue's lock, which A holds meanwhile: the
      // wait then ends at its limit.
      WaitUntil([&] { return returned.load(); }, std::chrono::milliseconds(100));
    };
    tBeforeFailing = &postOnB;
    tHeapAllocationsLeft = 1;  // the entry's node is had, the queue's growth fails
    EXPECT_THROW(PostCoalescedMessageToUIThread(Tarn::kStation_StatusBar, NumberMessage(1)), std::bad_alloc);
    tHeapAllocationsLeft = -1;
    b.join();
  }).join();
  FlushPostedMessagesOnUIThread();
  EXPECT_EQ(log.Entries().back(), "l:2");
  Tarn::StationUtils::RemoveListener(Tarn::kStation_StatusBar, &listener);
  Tarn::Messaging::Terminate();
}

// Once warmed up, posting and delivering take no general-heap storage at all:
// the copy is one small block, and the main thread's queue keeps the capacity
// of its two vectors from run to run.
TEST(PostingTest, SteadyPostingTakesNothingFromTheHeap) {
  Tarn::Messaging::Initialize();
  RecordingListener listener("l");
  Tarn::StationUtils::AddListener(Tarn::kStation_StatusBar, &listener);
  bool heapUsed = false;
  for (int round = 0; round < 6; ++round) {
    if (round == 2) gHeapAllocationsLeft.store(0);  // after two warm-up rounds
    try {
      for (int i = 0; i < 8; ++i) PostMessageToUIThread(Tarn::kStation_StatusBar, PingMessage(), true);
      FlushPostedMessagesOnUIThread();
    } catch (const std::bad_alloc&) {
      heapUsed = true;
    }
  }
  gHeapAllocationsLeft.store(-1);
  EXPECT_FALSE(heapUsed) << "a steady post or delivery allocated on the heap";
  FlushPostedMessagesOnUIThread();
  EXPECT_EQ(listener.Calls(), 48);
  Tarn::StationUtils::RemoveListener(Tarn::kStation_StatusBar, &listener);
  Tarn::Messaging::Terminate();
}

// A queue that grew while the main thread ran nothing used to say nothing,
// and kept the burst's storage once run (4M posts: 553 MiB, all kept). Posts
// made while the library is down wait for its next life.
TEST(PostingTest, ABurstIsReportedOnceAndGivesItsStorageBackOnceRun) {
  Tarn::Messaging::Initialize();
  ErrorRecorder errors;
  const std::size_t mark = Threads::SetPendingCallHighWaterMark(10000);
  RecordingListener listener("l");
  Tarn::StationUtils::AddListener(Tarn::kStation_StatusBar, &listener);
  const std::string station = std::string(" to station \"") + Tarn::kStation_StatusBar.c_str() + "\";";
  for (int burst = 1; burst <= 2; ++burst) {
    Threads::AsyncCallFromMainThread([] {}, 0);
    FlushPostedMessagesOnUIThread();  // a short run arms the report again
    const long long heap = gHeapBytes.load();
    [[maybe_unused]] const std::size_t chunks = mallinfo2().uordblks;  // read only where blocks are pooled
    Threads::AsyncCallFromMainThread([] {}, 0);
    for (int i = 0; i < 40000; ++i) {
      if (i % 4 == 0) PostMessageToUIThread(Tarn::kStation_StatusBar, PingMessage(), true);
      else PostMessageToUIThread(Tarn::kStation_StatusBar, NumberMessage(i), true);
    }
    ASSERT_EQ(errors.Count(), static_cast<std::size_t>(burst)) << "not reported once";
    const std::string report = errors.Entries().back().key;
    for (const char* part : {"holds 10001 calls", "7500 posts of ", "2500 posts of ", "; 1 other calls"})
      EXPECT_NE(report.find(part), std::string::npos) << part << " missing from " << report;
    EXPECT_NE(report.find(Tarn::Tracing::ReadableTypeName(typeid(PingMessage).name()) + station), std::string::npos);
    EXPECT_GT(gHeapBytes.load() - heap, 40000 * 32);
    FlushPostedMessagesOnUIThread();
    EXPECT_LT(gHeapBytes.load() - heap, 256 * 1024) << "the queue kept the burst's storage";
#if !defined(__SANITIZE_ADDRESS__)  // where small blocks are not pooled
    EXPECT_LT(mallinfo2().uordblks, chunks + 512 * 1024) << "the small-block pools kept the burst's chunks";
#endif
  }
  EXPECT_EQ(listener.Calls(), 80000);
  Tarn::StationUtils::RemoveListener(Tarn::kStation_StatusBar, &listener);
  Tarn::Messaging::Terminate();
  PostMessageToUIThread(Tarn::kStation_StatusBar, NumberMessage(1), false);  // no main thread: queued
  Tarn::Messaging::Initialize();
  Tarn::StationUtils::AddListener(Tarn::kStation_StatusBar, &listener);
  FlushPostedMessagesOnUIThread();
  EXPECT_EQ(listener.Calls(), 80001) << "a post made between lives did not reach the next one";
  Tarn::StationUtils::RemoveListener(Tarn::kStation_StatusBar, &listener);
  Tarn::Messaging::Terminate();
  Threads::SetPendingCallHighWaterMark(mark);
}

}  // namespace
