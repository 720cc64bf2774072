// Bringing the library up and down while storage runs out, and posting
// afterwards.
//
// This executable replaces the global operator new so that a test can make
// the general heap fail after a given number of allocations, as the
// small-block allocator can, and count the bytes it holds (the library
// reaches the executable's operators).
#include "TestSupport.h"

#include <TarnMessaging.h>

#include <kivcore/Error.h>
#include <kivcore/MainThread.h>
#include <kivcore/SmallBlockAllocator.h>

#include <gtest/gtest.h>

#include <malloc.h>

#include <atomic>
#include <cstdlib>
#include <new>
#include <string>
#include <thread>
#include <typeinfo>
#include <vector>

namespace {
// Allocations left before the heap fails; negative: never fails.
std::atomic<long long> gHeapAllocationsLeft{-1};
std::atomic<long long> gHeapBytes{0};  // held through operator new

void* Allocate(std::size_t inSize) {
  if (gHeapAllocationsLeft.load(std::memory_order_relaxed) >= 0 && gHeapAllocationsLeft.fetch_sub(1) <= 0)
    throw std::bad_alloc();
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
  std::vector<std::string> reports;
  const auto handler = kivcore::config::SetErrorHandler([&](const kivcore::config::ErrorReport& inReport) { reports.push_back(inReport.key); });
  const std::size_t mark = Threads::SetPendingCallHighWaterMark(10000);
  RecordingListener listener("l");
  Tarn::StationUtils::AddListener(Tarn::kStation_StatusBar, &listener);
  const std::string station = std::string(" to station \"") + Tarn::kStation_StatusBar.c_str() + "\";";
  for (int burst = 1; burst <= 2; ++burst) {
    Threads::AsyncCallFromMainThread([] {}, 0);
    FlushPostedMessagesOnUIThread();  // a short run arms the report again
    const long long heap = gHeapBytes.load();
    const std::size_t chunks = mallinfo2().uordblks;
    Threads::AsyncCallFromMainThread([] {}, 0);
    for (int i = 0; i < 40000; ++i) {
      if (i % 4 == 0) PostMessageToUIThread(Tarn::kStation_StatusBar, PingMessage(), true);
      else PostMessageToUIThread(Tarn::kStation_StatusBar, NumberMessage(i), true);
    }
    ASSERT_EQ(reports.size(), static_cast<std::size_t>(burst)) << "not reported once";
    for (const char* part : {"holds 10001 calls", "7500 posts of ", "2500 posts of ", "; 1 other calls"})
      EXPECT_NE(reports.back().find(part), std::string::npos) << part << " missing from " << reports.back();
    EXPECT_NE(reports.back().find(Tarn::Tracing::ReadableTypeName(typeid(PingMessage).name()) + station), std::string::npos);
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
  kivcore::config::SetErrorHandler(handler);
}

}  // namespace
