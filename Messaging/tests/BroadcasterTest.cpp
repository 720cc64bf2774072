// The broadcaster on one thread: its registry, delivery order, what handlers
// may do during a broadcast (add, remove, broadcast again), pruning,
// stopping, destruction orders, exceptions, and what a delivery allocates.
//
// This executable replaces the global operator new and delete with counting
// versions, so that a test can see whether a broadcast takes storage from
// the general heap (the messaging library and kivcore reach the same
// operators: the executable's definitions are the process's).
#include "TestSupport.h"

#include <TarnMessaging/Broadcaster.h>
#include <TarnMessaging/Listener.h>

#include <kivcore/MainThread.h>
#include <kivcore/SmallBlockAllocator.h>

#include <boost/make_shared.hpp>

#include <gtest/gtest.h>

#include <atomic>
#include <cstdlib>
#include <list>
#include <memory>
#include <new>
#include <random>
#include <stdexcept>
#include <string>
#include <vector>

namespace {
std::atomic<long long> gHeapAllocations{0};

void* CountedAllocate(std::size_t inSize) noexcept {
  gHeapAllocations.fetch_add(1, std::memory_order_relaxed);
  return std::malloc(inSize == 0 ? 1 : inSize);
}
void* CountedAllocateAligned(std::size_t inSize, std::align_val_t inAlignment) noexcept {
  gHeapAllocations.fetch_add(1, std::memory_order_relaxed);
  const auto alignment = static_cast<std::size_t>(inAlignment);
  const std::size_t size = (inSize + alignment - 1) / alignment * alignment;
  return std::aligned_alloc(alignment, size == 0 ? alignment : size);
}
// Out of line so that the compiler, inlining a delete next to its new,
// does not take the free for a mismatched deallocation.
__attribute__((noinline)) void CountedFree(void* inBlock) noexcept { std::free(inBlock); }
}  // namespace

void* operator new(std::size_t inSize) {
  if (void* block = CountedAllocate(inSize)) return block;
  throw std::bad_alloc();
}
void* operator new[](std::size_t inSize) {
  if (void* block = CountedAllocate(inSize)) return block;
  throw std::bad_alloc();
}
void* operator new(std::size_t inSize, const std::nothrow_t&) noexcept { return CountedAllocate(inSize); }
void* operator new[](std::size_t inSize, const std::nothrow_t&) noexcept { return CountedAllocate(inSize); }
void* operator new(std::size_t inSize, std::align_val_t inAlignment) {
  if (void* block = CountedAllocateAligned(inSize, inAlignment)) return block;
  throw std::bad_alloc();
}
void* operator new[](std::size_t inSize, std::align_val_t inAlignment) {
  if (void* block = CountedAllocateAligned(inSize, inAlignment)) return block;
  throw std::bad_alloc();
}
void operator delete(void* inBlock) noexcept { CountedFree(inBlock); }
void operator delete[](void* inBlock) noexcept { CountedFree(inBlock); }
void operator delete(void* inBlock, std::size_t) noexcept { CountedFree(inBlock); }
void operator delete[](void* inBlock, std::size_t) noexcept { CountedFree(inBlock); }
void operator delete(void* inBlock, const std::nothrow_t&) noexcept { CountedFree(inBlock); }
void operator delete[](void* inBlock, const std::nothrow_t&) noexcept { CountedFree(inBlock); }
void operator delete(void* inBlock, std::align_val_t) noexcept { CountedFree(inBlock); }
void operator delete[](void* inBlock, std::align_val_t) noexcept { CountedFree(inBlock); }
void operator delete(void* inBlock, std::size_t, std::align_val_t) noexcept { CountedFree(inBlock); }
void operator delete[](void* inBlock, std::size_t, std::align_val_t) noexcept { CountedFree(inBlock); }

using kivcore::utility::SmallBlockAllocator;
using messaging_test::AnyListener;
using messaging_test::CallLog;
using messaging_test::ExceptionRecorder;
using messaging_test::KindParamName;
using messaging_test::ListenerKind;
using messaging_test::MainThreadGuard;
using messaging_test::NumberMessage;
using messaging_test::PingMessage;
using messaging_test::RecordingListener;
using messaging_test::Watchdog;
using Log = std::vector<std::string>;

namespace {

class BroadcasterTest : public ::testing::Test {
protected:
  MainThreadGuard mMainThread;
  CallLog mLog;
  Tarn::Broadcaster mBroadcaster;
};

// The same body for each way of holding a listener.
class BroadcasterKinds : public BroadcasterTest, public ::testing::WithParamInterface<ListenerKind> {};

INSTANTIATE_TEST_SUITE_P(AllKinds, BroadcasterKinds, ::testing::ValuesIn(messaging_test::kAllListenerKinds),
                         KindParamName());

// The same body for each kind whose listener has a shared owner.
class BroadcasterSharedKinds : public BroadcasterTest, public ::testing::WithParamInterface<ListenerKind> {};

INSTANTIATE_TEST_SUITE_P(SharedKinds, BroadcasterSharedKinds,
                         ::testing::ValuesIn(messaging_test::kSharedListenerKinds), KindParamName());

// ---------------------------------------------------------------------------
// Registry

TEST_F(BroadcasterTest, NewBroadcasterHasNoListenersAndIsBroadcasting) {
  EXPECT_FALSE(mBroadcaster.HasListeners());
  EXPECT_TRUE(mBroadcaster.IsBroadcasting());
  mBroadcaster.BroadcastMessage(PingMessage());  // nothing to serve, nothing to fail
  EXPECT_FALSE(mBroadcaster.HasListeners());
}

TEST_F(BroadcasterTest, AddingTheSamePlainListenerTwiceLeavesOneEntryAndOneBackLink) {
  RecordingListener listener("A", &mLog);
  mBroadcaster.AddListener(&listener);
  const SmallBlockAllocator::Statistics afterFirst = SmallBlockAllocator::GetStatistics();
  mBroadcaster.AddListener(&listener);
  // Neither a second entry nor a second back-link took storage.
  EXPECT_EQ(afterFirst.blocksInUse, SmallBlockAllocator::GetStatistics().blocksInUse);
  mBroadcaster.BroadcastMessage(NumberMessage(1));
  EXPECT_EQ(Log{"A:1"}, mLog.Entries());
  mBroadcaster.RemoveListener(&listener, true);
  EXPECT_FALSE(mBroadcaster.HasListener(&listener));
  EXPECT_FALSE(listener.HasBroadcaster(&mBroadcaster));
}

TEST_F(BroadcasterTest, WeakPointersSharingOwnershipDenoteOneRegistration) {
  auto boostOwner = boost::make_shared<RecordingListener>("boost", &mLog);
  const boost::shared_ptr<Tarn::Listener> boostAlias(boostOwner, boostOwner.get());
  auto stdOwner = std::make_shared<RecordingListener>("std", &mLog);
  const std::shared_ptr<Tarn::Listener> stdAlias(stdOwner, stdOwner.get());

  mBroadcaster.AddListener(boost::weak_ptr<Tarn::Listener>(boostOwner));
  mBroadcaster.AddListener(boost::weak_ptr<Tarn::Listener>(boostAlias));
  mBroadcaster.AddListener(std::weak_ptr<Tarn::Listener>(stdOwner));
  mBroadcaster.AddListener(std::weak_ptr<Tarn::Listener>(stdAlias));
  mBroadcaster.BroadcastMessage(NumberMessage(1));
  EXPECT_EQ((Log{"std:1", "boost:1"}), mLog.Entries());

  mBroadcaster.RemoveListener(boost::weak_ptr<Tarn::Listener>(boostAlias));
  mBroadcaster.RemoveListener(std::weak_ptr<Tarn::Listener>(stdAlias));
  EXPECT_FALSE(mBroadcaster.HasListeners());
}

TEST_F(BroadcasterTest, SameListenerByPlainAndWeakPointerIsTwoRegistrations) {
  auto listener = std::make_shared<RecordingListener>("A", &mLog);
  mBroadcaster.AddListener(listener.get());
  mBroadcaster.AddListener(std::weak_ptr<Tarn::Listener>(listener));
  mBroadcaster.BroadcastMessage(NumberMessage(1));
  listener->StopListening();  // skips the plain entry only
  mBroadcaster.BroadcastMessage(NumberMessage(2));
  EXPECT_EQ((Log{"A:1", "A:1", "A:2"}), mLog.Entries());
  mBroadcaster.RemoveListener(listener.get(), true);
  EXPECT_TRUE(mBroadcaster.HasListeners());  // the weak registration remains
}

TEST_F(BroadcasterTest, RemovingAnUnregisteredListenerChangesNothing) {
  RecordingListener registered("A", &mLog);
  RecordingListener stranger("S", &mLog);
  auto weakStranger = std::make_shared<RecordingListener>("W", &mLog);
  mBroadcaster.AddListener(&registered);
  mBroadcaster.RemoveListener(&stranger, true);
  mBroadcaster.RemoveListener(std::weak_ptr<Tarn::Listener>(weakStranger));
  mBroadcaster.BroadcastMessage(NumberMessage(1));
  EXPECT_EQ(Log{"A:1"}, mLog.Entries());
  EXPECT_TRUE(registered.HasBroadcaster(&mBroadcaster));
}

TEST_F(BroadcasterTest, RemovalWithUpdateDropsTheBackLinkEvenWithoutAnEntry) {
  RecordingListener listener("A");
  mBroadcaster.AddListener(&listener);
  mBroadcaster.RemoveListener(&listener, false);  // the entry goes; the back-link stays
  EXPECT_FALSE(mBroadcaster.HasListener(&listener));
  EXPECT_TRUE(listener.HasBroadcaster(&mBroadcaster));
  mBroadcaster.RemoveListener(&listener, true);
  EXPECT_FALSE(listener.HasBroadcaster(&mBroadcaster));
}

TEST_F(BroadcasterTest, HasListenerDoesNotFindWeakRegistrations) {
  auto listener = std::make_shared<RecordingListener>("A");
  auto boostListener = boost::make_shared<RecordingListener>("B");
  mBroadcaster.AddListener(std::weak_ptr<Tarn::Listener>(listener));
  mBroadcaster.AddListener(boost::weak_ptr<Tarn::Listener>(boostListener));
  EXPECT_TRUE(mBroadcaster.HasListeners());
  EXPECT_FALSE(mBroadcaster.HasListener(listener.get()));
  EXPECT_FALSE(mBroadcaster.HasListener(boostListener.get()));
}

TEST_P(BroadcasterSharedKinds, HasListenersStaysTrueUntilADeadRegistrationIsPruned) {
  AnyListener listener(GetParam(), "A", &mLog);
  listener.Attach(mBroadcaster);
  listener.Destroy();
  ASSERT_TRUE(listener.IsDestroyed());
  EXPECT_TRUE(mBroadcaster.HasListeners());
  mBroadcaster.BroadcastMessage(NumberMessage(1));
  EXPECT_FALSE(mBroadcaster.HasListeners());
  EXPECT_TRUE(mLog.Entries().empty());
}

TEST_F(BroadcasterTest, CopyHasNoListenersAndKeepsTheBroadcastingState) {
  RecordingListener listener("A", &mLog);
  mBroadcaster.AddListener(&listener);
  mBroadcaster.StopBroadcasting();
  Tarn::Broadcaster copy(mBroadcaster);
  EXPECT_FALSE(copy.IsBroadcasting());
  EXPECT_FALSE(copy.HasListeners());
  EXPECT_FALSE(copy.HasListener(&listener));
  EXPECT_FALSE(listener.HasBroadcaster(&copy));
  copy.StartBroadcasting();
  copy.BroadcastMessage(NumberMessage(1));
  EXPECT_TRUE(mLog.Entries().empty());
  EXPECT_TRUE(mBroadcaster.HasListener(&listener));
}

// ---------------------------------------------------------------------------
// Listeners and their back-links

TEST(ListenerState, NewListenerIsListening) {
  const RecordingListener listener("A");
  EXPECT_TRUE(listener.IsListening());
  EXPECT_TRUE(listener.GetListenState());
}

TEST(ListenerState, ProcessMessageReachesAStoppedListener) {
  CallLog log;
  RecordingListener listener("A", &log);
  listener.StopListening();
  EXPECT_FALSE(listener.GetListenState());
  listener.ProcessMessage(NumberMessage(1));
  EXPECT_EQ(Log{"A:1"}, log.Entries());
}

// A listener with nothing of its own, so that it can be copied.
struct CopyableListener : Tarn::Listener {
  void ListenToMessage(const Tarn::Message&) override {}
};

TEST_F(BroadcasterTest, ListenerCopyIsAttachedNowhereAndKeepsTheListenState) {
  CopyableListener original;
  Tarn::Broadcaster other;
  mBroadcaster.AddListener(&original);
  other.AddListener(&original);
  original.StopListening();
  CopyableListener copy(original);
  EXPECT_FALSE(copy.HasBroadcaster(&mBroadcaster));
  EXPECT_FALSE(copy.HasBroadcaster(&other));
  EXPECT_FALSE(copy.IsListening());
  EXPECT_FALSE(mBroadcaster.HasListener(&copy));
  EXPECT_TRUE(original.HasBroadcaster(&mBroadcaster));
}

TEST_F(BroadcasterTest, ListenerAssignmentCopiesTheListenStateAndKeepsAttachments) {
  RecordingListener attached("A", &mLog);
  RecordingListener stopped("B");
  stopped.StopListening();
  mBroadcaster.AddListener(&attached);
  static_cast<Tarn::Listener&>(attached) = stopped;
  EXPECT_FALSE(attached.IsListening());
  EXPECT_TRUE(attached.HasBroadcaster(&mBroadcaster));
  EXPECT_FALSE(stopped.HasBroadcaster(&mBroadcaster));
  EXPECT_TRUE(mBroadcaster.HasListener(&attached));
}

TEST_F(BroadcasterTest, ListenerAttachedToTwoBroadcastersAndDestroyedLeavesBoth) {
  Tarn::Broadcaster other;
  auto listener = std::make_unique<RecordingListener>("A", &mLog);
  Tarn::Listener* const address = listener.get();
  mBroadcaster.AddListener(listener.get());
  other.AddListener(listener.get());
  EXPECT_TRUE(listener->HasBroadcaster(&mBroadcaster));
  EXPECT_TRUE(listener->HasBroadcaster(&other));
  listener.reset();
  EXPECT_FALSE(mBroadcaster.HasListener(address));
  EXPECT_FALSE(other.HasListener(address));
  EXPECT_FALSE(mBroadcaster.HasListeners());
  EXPECT_FALSE(other.HasListeners());
  mBroadcaster.BroadcastMessage(NumberMessage(1));
  other.BroadcastMessage(NumberMessage(2));
  EXPECT_TRUE(mLog.Entries().empty());
}

TEST_F(BroadcasterTest, DestroyedBroadcasterIsDroppedFromItsListenersBackLinks) {
  RecordingListener first("A");
  RecordingListener second("B");
  auto broadcaster = std::make_unique<Tarn::Broadcaster>();
  Tarn::Broadcaster* const address = broadcaster.get();
  broadcaster->AddListener(&first);
  broadcaster->AddListener(&second);
  mBroadcaster.AddListener(&first);
  broadcaster.reset();
  EXPECT_FALSE(first.HasBroadcaster(address));
  EXPECT_FALSE(second.HasBroadcaster(address));
  EXPECT_TRUE(first.HasBroadcaster(&mBroadcaster));  // other attachments stay
  // The listeners' destructors must not reach the destroyed broadcaster;
  // the sanitizer builds see it if they do.
}

TEST_F(BroadcasterTest, DestroyedBroadcasterLeavesItsWeakListenersAlone) {
  auto listener = std::make_shared<RecordingListener>("A", &mLog);
  {
    Tarn::Broadcaster broadcaster;
    broadcaster.AddListener(std::weak_ptr<Tarn::Listener>(listener));
  }
  EXPECT_EQ(1, listener.use_count());
  mBroadcaster.AddListener(std::weak_ptr<Tarn::Listener>(listener));
  mBroadcaster.BroadcastMessage(NumberMessage(1));
  EXPECT_EQ(Log{"A:1"}, mLog.Entries());
}

// ---------------------------------------------------------------------------
// Listening and broadcasting states

TEST_F(BroadcasterTest, StoppedPlainListenerIsSkippedButStaysRegistered) {
  RecordingListener listener("A", &mLog);
  mBroadcaster.AddListener(&listener);
  listener.StopListening();
  mBroadcaster.BroadcastMessage(NumberMessage(1));
  EXPECT_TRUE(mBroadcaster.HasListener(&listener));
  listener.StartListening();
  mBroadcaster.BroadcastMessage(NumberMessage(2));
  EXPECT_EQ(Log{"A:2"}, mLog.Entries());
}

TEST_F(BroadcasterTest, StoppedWeakListenersAreServedAnyway) {
  auto stdOwner = std::make_shared<RecordingListener>("std", &mLog);
  auto boostOwner = boost::make_shared<RecordingListener>("boost", &mLog);
  stdOwner->StopListening();
  boostOwner->StopListening();
  mBroadcaster.AddListener(std::weak_ptr<Tarn::Listener>(stdOwner));
  mBroadcaster.AddListener(boost::weak_ptr<Tarn::Listener>(boostOwner));
  mBroadcaster.BroadcastMessage(NumberMessage(1));
  EXPECT_EQ((Log{"boost:1", "std:1"}), mLog.Entries());
}

TEST_F(BroadcasterTest, StoppedBroadcasterDeliversNothingAndKeepsNothingForLater) {
  RecordingListener listener("A", &mLog);
  mBroadcaster.AddListener(&listener);
  mBroadcaster.StopBroadcasting();
  EXPECT_FALSE(mBroadcaster.IsBroadcasting());
  mBroadcaster.BroadcastMessage(NumberMessage(1));
  EXPECT_TRUE(mLog.Entries().empty());
  mBroadcaster.StartBroadcasting();
  mBroadcaster.BroadcastMessage(NumberMessage(2));
  EXPECT_EQ(Log{"A:2"}, mLog.Entries());
}

TEST(BroadcastWithoutMainThread, DeliversNothing) {
  ASSERT_FALSE(kivcore::threads::CurrentThreadIsMainThread()) << "a main thread was left registered";
  CallLog log;
  RecordingListener listener("A", &log);
  Tarn::Broadcaster broadcaster;
  broadcaster.AddListener(&listener);
  broadcaster.BroadcastMessage(NumberMessage(1));
  EXPECT_TRUE(log.Entries().empty());
  EXPECT_TRUE(broadcaster.HasListener(&listener));
}

// ---------------------------------------------------------------------------
// Order and re-entrancy

TEST_P(BroadcasterKinds, ListenersAreServedNewestFirst) {
  AnyListener a(GetParam(), "A", &mLog);
  AnyListener b(GetParam(), "B", &mLog);
  AnyListener c(GetParam(), "C", &mLog);
  a.Attach(mBroadcaster);
  b.Attach(mBroadcaster);
  c.Attach(mBroadcaster);
  mBroadcaster.BroadcastMessage(NumberMessage(1));
  EXPECT_EQ((Log{"C:1", "B:1", "A:1"}), mLog.Entries());
}

TEST_F(BroadcasterTest, ListenersOfEveryKindShareOneOrder) {
  AnyListener plain(ListenerKind::kPlainPointer, "plain", &mLog);
  AnyListener safe(ListenerKind::kSafe, "safe", &mLog);
  AnyListener boostWeak(ListenerKind::kBoostWeak, "boost", &mLog);
  AnyListener stdWeak(ListenerKind::kStdWeak, "std", &mLog);
  plain.Attach(mBroadcaster);
  safe.Attach(mBroadcaster);
  boostWeak.Attach(mBroadcaster);
  stdWeak.Attach(mBroadcaster);
  mBroadcaster.BroadcastMessage(NumberMessage(1));
  EXPECT_EQ((Log{"std:1", "boost:1", "safe:1", "plain:1"}), mLog.Entries());
}

TEST_P(BroadcasterKinds, ListenerAddedByAHandlerIsServedFirstByTheNextBroadcastOnly) {
  AnyListener added(GetParam(), "N", &mLog);
  RecordingListener adder("Adder", &mLog);
  RecordingListener older("Older", &mLog);
  bool done = false;
  adder.SetAction([&](const Tarn::Message&) {
    if (!done) added.Attach(mBroadcaster);
    done = true;
  });
  mBroadcaster.AddListener(&older);
  mBroadcaster.AddListener(&adder);
  mBroadcaster.BroadcastMessage(NumberMessage(1));
  mBroadcaster.BroadcastMessage(NumberMessage(2));
  EXPECT_EQ((Log{"Adder:1", "Older:1", "N:2", "Adder:2", "Older:2"}), mLog.Entries());
}

TEST_P(BroadcasterKinds, ListenerRemovedByAHandlerBeforeItsTurnIsNeverCalled) {
  AnyListener victim(GetParam(), "V", &mLog);
  RecordingListener remover("Remover", &mLog);
  RecordingListener last("Last", &mLog);
  remover.SetAction([&](const Tarn::Message&) { victim.Detach(mBroadcaster); });
  mBroadcaster.AddListener(&last);
  victim.Attach(mBroadcaster);
  mBroadcaster.AddListener(&remover);
  mBroadcaster.BroadcastMessage(NumberMessage(1));
  mBroadcaster.BroadcastMessage(NumberMessage(2));
  EXPECT_EQ((Log{"Remover:1", "Last:1", "Remover:2", "Last:2"}), mLog.Entries());
  EXPECT_EQ(0, victim.Calls());
}

TEST_P(BroadcasterKinds, HandlerRemovingItsOwnListenerReturnsAndTheBroadcastGoesOn) {
  Watchdog watchdog;  // a removal that waited here would never end
  RecordingListener first("First", &mLog);
  AnyListener self(GetParam(), "Self", &mLog);
  RecordingListener newest("Newest", &mLog);
  self.SetAction([&](const Tarn::Message&) { self.Detach(mBroadcaster); });
  mBroadcaster.AddListener(&first);
  self.Attach(mBroadcaster);
  mBroadcaster.AddListener(&newest);
  mBroadcaster.BroadcastMessage(NumberMessage(1));
  mBroadcaster.BroadcastMessage(NumberMessage(2));
  EXPECT_EQ((Log{"Newest:1", "Self:1", "First:1", "Newest:2", "First:2"}), mLog.Entries());
}

TEST_F(BroadcasterTest, HandlerRemovingAnAlreadyServedListenerDoesNotDisturbTheBroadcast) {
  RecordingListener a("A", &mLog);
  RecordingListener b("B", &mLog);
  RecordingListener c("C", &mLog);
  b.SetAction([&](const Tarn::Message&) { mBroadcaster.RemoveListener(&c, true); });
  mBroadcaster.AddListener(&a);
  mBroadcaster.AddListener(&b);
  mBroadcaster.AddListener(&c);
  mBroadcaster.BroadcastMessage(NumberMessage(1));
  mBroadcaster.BroadcastMessage(NumberMessage(2));
  EXPECT_EQ((Log{"C:1", "B:1", "A:1", "B:2", "A:2"}), mLog.Entries());
}

TEST_F(BroadcasterTest, HandlerRemovingAndReaddingItselfIsServedFirstNextTime) {
  RecordingListener a("A", &mLog);
  RecordingListener b("B", &mLog);
  RecordingListener c("C", &mLog);
  int rounds = 0;
  b.SetAction([&](const Tarn::Message&) {
    if (rounds++ > 0) return;
    mBroadcaster.RemoveListener(&b, true);
    mBroadcaster.AddListener(&b);
  });
  mBroadcaster.AddListener(&a);
  mBroadcaster.AddListener(&b);
  mBroadcaster.AddListener(&c);
  mBroadcaster.BroadcastMessage(NumberMessage(1));
  mBroadcaster.BroadcastMessage(NumberMessage(2));
  EXPECT_EQ((Log{"C:1", "B:1", "A:1", "B:2", "C:2", "A:2"}), mLog.Entries());
  EXPECT_TRUE(b.HasBroadcaster(&mBroadcaster));
}

TEST_F(BroadcasterTest, HandlerDestroyingAListenerNotYetServedSkipsIt) {
  RecordingListener a("A", &mLog);
  auto doomed = std::make_unique<RecordingListener>("D", &mLog);
  RecordingListener killer("K", &mLog);
  killer.SetAction([&](const Tarn::Message&) { doomed.reset(); });
  mBroadcaster.AddListener(&a);
  mBroadcaster.AddListener(doomed.get());
  mBroadcaster.AddListener(&killer);
  mBroadcaster.BroadcastMessage(NumberMessage(1));
  EXPECT_EQ((Log{"K:1", "A:1"}), mLog.Entries());
}

TEST_F(BroadcasterTest, NestedBroadcastServesEveryoneThenTheOuterServesEachRemainingOnce) {
  RecordingListener a("A", &mLog);
  RecordingListener b("B", &mLog);
  RecordingListener c("C", &mLog);
  b.SetAction([&](const Tarn::Message& inMessage) {
    if (static_cast<const NumberMessage&>(inMessage).mValue == 1) mBroadcaster.BroadcastMessage(NumberMessage(2));
  });
  mBroadcaster.AddListener(&a);
  mBroadcaster.AddListener(&b);
  mBroadcaster.AddListener(&c);
  mBroadcaster.BroadcastMessage(NumberMessage(1));
  EXPECT_EQ((Log{"C:1", "B:1", "C:2", "B:2", "A:2", "A:1"}), mLog.Entries());
}

TEST_F(BroadcasterTest, RemovalInsideANestedBroadcastIsSeenByTheOuterOne) {
  RecordingListener a("A", &mLog);
  RecordingListener b("B", &mLog);
  RecordingListener c("C", &mLog);
  c.SetAction([&](const Tarn::Message& inMessage) {
    if (static_cast<const NumberMessage&>(inMessage).mValue == 1) mBroadcaster.BroadcastMessage(NumberMessage(2));
  });
  // During the nested broadcast, B removes A, which the outer has not served.
  b.SetAction([&](const Tarn::Message& inMessage) {
    if (static_cast<const NumberMessage&>(inMessage).mValue == 2) mBroadcaster.RemoveListener(&a, true);
  });
  mBroadcaster.AddListener(&a);
  mBroadcaster.AddListener(&b);
  mBroadcaster.AddListener(&c);
  mBroadcaster.BroadcastMessage(NumberMessage(1));
  EXPECT_EQ((Log{"C:1", "C:2", "B:2", "B:1"}), mLog.Entries());
}

TEST_F(BroadcasterTest, NestedBroadcastsOnTwoLevelsEachServeTheWholeRegistry) {
  RecordingListener a("A", &mLog);
  RecordingListener b("B", &mLog);
  a.SetAction([&](const Tarn::Message& inMessage) {
    const int value = static_cast<const NumberMessage&>(inMessage).mValue;
    if (value < 3) mBroadcaster.BroadcastMessage(NumberMessage(value + 1));
  });
  mBroadcaster.AddListener(&a);
  mBroadcaster.AddListener(&b);
  mBroadcaster.BroadcastMessage(NumberMessage(1));
  EXPECT_EQ((Log{"B:1", "A:1", "B:2", "A:2", "B:3", "A:3"}), mLog.Entries());
}

TEST_P(BroadcasterSharedKinds, ListenerWhoseOwnerGoesInItsHandlerLivesUntilItReturns) {
  auto listener = std::make_unique<AnyListener>(GetParam(), "A", &mLog);
  const auto probe = listener->GetProbe();
  bool aliveAfterRelease = false;
  listener->SetAction([&](const Tarn::Message&) {
    listener->Destroy();
    aliveAfterRelease = !probe->mDestroyed.load();
  });
  listener->Attach(mBroadcaster);
  mBroadcaster.BroadcastMessage(NumberMessage(1));
  EXPECT_TRUE(aliveAfterRelease);
  EXPECT_TRUE(probe->mDestroyed.load());
  mBroadcaster.BroadcastMessage(NumberMessage(2));
  EXPECT_EQ(Log{"A:1"}, mLog.Entries());
  EXPECT_FALSE(mBroadcaster.HasListeners());
}

// ---------------------------------------------------------------------------
// Exceptions

TEST_F(BroadcasterTest, ExceptionFromAHandlerGoesToTheErrorManagerAndTheBroadcastGoesOn) {
  ExceptionRecorder exceptions;
  RecordingListener a("A", &mLog);
  RecordingListener thrower("T", &mLog);
  RecordingListener c("C", &mLog);
  thrower.SetAction([](const Tarn::Message&) { throw std::runtime_error("handler failed"); });
  mBroadcaster.AddListener(&a);
  mBroadcaster.AddListener(&thrower);
  mBroadcaster.AddListener(&c);
  mBroadcaster.BroadcastMessage(NumberMessage(1));
  EXPECT_EQ((Log{"C:1", "T:1", "A:1"}), mLog.Entries());
  EXPECT_EQ(Log{"handler failed"}, exceptions.Messages());
  mLog.Clear();
  mBroadcaster.BroadcastMessage(NumberMessage(2));
  EXPECT_EQ((Log{"C:2", "T:2", "A:2"}), mLog.Entries());
  EXPECT_EQ(2u, exceptions.Count());
}

TEST_F(BroadcasterTest, ExceptionOfAnyTypeInANestedBroadcastLeavesBothLevelsGoing) {
  ExceptionRecorder exceptions;
  RecordingListener a("A", &mLog);
  RecordingListener b("B", &mLog);
  a.SetAction([](const Tarn::Message& inMessage) {
    if (static_cast<const NumberMessage&>(inMessage).mValue == 2) throw 42;
  });
  b.SetAction([&](const Tarn::Message& inMessage) {
    if (static_cast<const NumberMessage&>(inMessage).mValue == 1) mBroadcaster.BroadcastMessage(NumberMessage(2));
  });
  mBroadcaster.AddListener(&a);
  mBroadcaster.AddListener(&b);
  mBroadcaster.BroadcastMessage(NumberMessage(1));
  EXPECT_EQ((Log{"B:1", "B:2", "A:2", "A:1"}), mLog.Entries());
  EXPECT_EQ(Log{"unknown"}, exceptions.Messages());
}

// ---------------------------------------------------------------------------
// Storage

TEST(HeapCounter, SeesAllocationsMadeInsideTheSharedLibraries) {
  using kivcore::config::ErrorManager;
  const ErrorManager::ExceptionHandler quiet = [](std::exception_ptr) {};  // small enough to need no heap
  const long long before = gHeapAllocations.load();
  ErrorManager::ExceptionHandler previous = ErrorManager::SetExceptionHandler(quiet);  // kivcore copies it to the heap
  EXPECT_GT(gHeapAllocations.load(), before);
  ErrorManager::SetExceptionHandler(std::move(previous));
}

TEST_F(BroadcasterTest, DeliveryTakesNoStorageFromTheHeapOrTheSmallBlockAllocator) {
  AnyListener plain(ListenerKind::kPlainPointer, "plain");
  AnyListener safe(ListenerKind::kSafe, "safe");
  AnyListener boostWeak(ListenerKind::kBoostWeak, "boost");
  AnyListener stdWeak(ListenerKind::kStdWeak, "std");
  plain.Attach(mBroadcaster);
  safe.Attach(mBroadcaster);
  boostWeak.Attach(mBroadcaster);
  stdWeak.Attach(mBroadcaster);
  const NumberMessage message(1);
  mBroadcaster.BroadcastMessage(message);  // the first broadcast may size the broadcaster's cursor storage

  const long long heapBefore = gHeapAllocations.load();
  const std::uint64_t smallBefore = SmallBlockAllocator::GetStatistics().allocations;
  mBroadcaster.BroadcastMessage(message);
  const long long heapAllocations = gHeapAllocations.load() - heapBefore;
  const std::uint64_t smallAllocations = SmallBlockAllocator::GetStatistics().allocations - smallBefore;

  EXPECT_EQ(0, heapAllocations);
  EXPECT_EQ(0u, smallAllocations);
  EXPECT_EQ(2, plain.Calls());
  EXPECT_EQ(2, safe.Calls());
  EXPECT_EQ(2, boostWeak.Calls());
  EXPECT_EQ(2, stdWeak.Calls());
}

TEST_F(BroadcasterTest, RegistriesTakeTheirStorageFromTheSmallBlockAllocatorOnly) {
  RecordingListener plain("plain");
  auto boostOwner = boost::make_shared<RecordingListener>("boost");
  auto stdOwner = std::make_shared<RecordingListener>("std");
  const Tarn::ISafeListenerRef safe(new messaging_test::CountedSafeListener("safe"));
  const boost::weak_ptr<Tarn::Listener> boostWeak(boostOwner);
  const std::weak_ptr<Tarn::Listener> stdWeak(stdOwner);

  const SmallBlockAllocator::Statistics smallBefore = SmallBlockAllocator::GetStatistics();
  const long long heapBefore = gHeapAllocations.load();
  {
    Tarn::Broadcaster broadcaster;  // a fresh registry: its first entries need new storage
    broadcaster.AddListener(&plain);
    broadcaster.AddListener(boostWeak);
    broadcaster.AddListener(stdWeak);
    broadcaster.AddListener(safe);
    broadcaster.RemoveListener(&plain, true);
    broadcaster.RemoveListener(boostWeak);
    broadcaster.RemoveListener(stdWeak);
    broadcaster.RemoveListener(safe);
    broadcaster.AddListener(&plain);  // left for the destructor to detach
  }
  const long long heapAllocations = gHeapAllocations.load() - heapBefore;
  const SmallBlockAllocator::Statistics smallAfter = SmallBlockAllocator::GetStatistics();
  EXPECT_EQ(0, heapAllocations);
  EXPECT_GT(smallAfter.allocations, smallBefore.allocations);
  EXPECT_EQ(smallBefore.blocksInUse, smallAfter.blocksInUse);
  EXPECT_EQ(smallBefore.bytesInUse, smallAfter.bytesInUse);
}

}  // namespace
