// Counted safe listeners: InterfaceRef counting and conversion, the
// weak-reference block and its resolution, and how a broadcaster holds such
// a listener without keeping it alive.
#include "TestSupport.h"

#include <TarnMessaging/Broadcaster.h>
#include <TarnMessaging/NullInterfaceException.h>
#include <TarnMessaging/SafeListener.h>

#include <gtest/gtest.h>

#include <cstdint>
#include <cstring>
#include <string>
#include <vector>

using messaging_test::CallLog;
using messaging_test::CountedSafeListener;
using messaging_test::MainThreadGuard;
using messaging_test::NumberMessage;
using messaging_test::PingMessage;
using Tarn::ISafeListenerRef;
using Tarn::IWeakReferenceCapableRef;

namespace {

// Counts references without ever deleting itself (it lives on the test's
// stack), and offers only the interfaces it is told to. Both C++ interfaces
// are there, so that a reference of either kind can be made to it.
class ScriptedObject : public Tarn::ISafeListener, public Tarn::IWeakReferenceCapable {
public:
  explicit ScriptedObject(bool inOffersSafeListener, bool inOffersWeakReference)
      : mOffersSafeListener(inOffersSafeListener), mOffersWeakReference(inOffersWeakReference) {
    mBlock->mObject = static_cast<Tarn::ISafeListener*>(this);
  }

  std::int32_t AddRef() override { return mBlock->mRefCount.fetch_add(1) + 1; }
  std::int32_t Release() override { return mBlock->mRefCount.fetch_sub(1) - 1; }
  std::int32_t QueryInterface(const Tarn::IID& inIID, void** outInterface) override {
    ++mQueries;
    *outInterface = nullptr;
    if (mOffersSafeListener && inIID == Tarn::IID_ISafeListener) *outInterface = static_cast<Tarn::ISafeListener*>(this);
    if (mOffersWeakReference && inIID == Tarn::IID_IWeakReferenceCapable)
      *outInterface = static_cast<Tarn::IWeakReferenceCapable*>(this);
    return *outInterface != nullptr ? Tarn::kInterfaceOK : Tarn::kNoInterface;
  }
  boost::shared_ptr<Tarn::WeakReference> GetWeakReference() override { return mBlock; }
  void ListenToMessage(const Tarn::Message&) override { ++mCalls; }

  std::int32_t Count() const { return mBlock->mRefCount.load(); }

  int mCalls = 0;
  int mQueries = 0;

private:
  const bool mOffersSafeListener;
  const bool mOffersWeakReference;
  const boost::shared_ptr<Tarn::WeakReference> mBlock = boost::make_shared<Tarn::WeakReference>();
};

// The number of holders of an object's weak-reference block besides the
// object itself.
long OtherBlockHolders(CountedSafeListener& inObject) {
  return inObject.GetWeakReference().use_count() - 2;  // minus the object's and this temporary's
}

// ---------------------------------------------------------------------------
// InterfaceRef

TEST(InterfaceRef, DefaultReferenceIsNull) {
  const ISafeListenerRef ref;
  EXPECT_TRUE(ref == nullptr);
  EXPECT_FALSE(static_cast<bool>(ref));
  EXPECT_EQ(nullptr, ref.get());
}

TEST(InterfaceRef, ReferenceMadeFromAPointerAddsOneAndReleasesItAtTheEnd) {
  ScriptedObject object(true, true);
  {
    const ISafeListenerRef ref(&object);
    EXPECT_EQ(1, object.Count());
    EXPECT_EQ(&object, static_cast<ScriptedObject*>(ref.get()));
  }
  EXPECT_EQ(0, object.Count());
}

TEST(InterfaceRef, CopiesCountAndMovesDoNot) {
  ScriptedObject object(true, true);
  ISafeListenerRef first(&object);
  {
    const ISafeListenerRef copy(first);
    EXPECT_EQ(2, object.Count());
    EXPECT_TRUE(copy == first);
  }
  EXPECT_EQ(1, object.Count());
  const ISafeListenerRef moved(std::move(first));
  EXPECT_EQ(1, object.Count());
  EXPECT_TRUE(first == nullptr);  // NOLINT(bugprone-use-after-move): the moved-from reference is null
}

TEST(InterfaceRef, AssignmentReleasesTheOldObjectAndCountsTheNewOne) {
  ScriptedObject one(true, true);
  ScriptedObject two(true, true);
  ISafeListenerRef ref(&one);
  const ISafeListenerRef other(&two);
  ref = other;
  EXPECT_EQ(0, one.Count());
  EXPECT_EQ(2, two.Count());
  ref = ref;  // self-assignment keeps the one reference it holds
  EXPECT_EQ(2, two.Count());
  ref = nullptr;
  EXPECT_EQ(1, two.Count());
}

TEST(InterfaceRef, AdoptTakesOverAReferenceWithoutAddingOne) {
  ScriptedObject object(true, true);
  object.AddRef();
  {
    const ISafeListenerRef ref = ISafeListenerRef::Adopt(&object);
    EXPECT_EQ(1, object.Count());
  }
  EXPECT_EQ(0, object.Count());
}

TEST(InterfaceRef, DereferencingANullReferenceThrowsNullInterfaceException) {
  const ISafeListenerRef ref;
  try {
    ref->ListenToMessage(PingMessage());
    FAIL() << "no exception";
  } catch (const Tarn::NullInterfaceException& error) {
    EXPECT_EQ(0, std::strncmp("A NULL interface pointer has been dereferenced: ", error.what(), 48)) << error.what();
  }
  EXPECT_THROW(static_cast<void>(*ref), Tarn::NullInterfaceException);
}

TEST(InterfaceRef, ConversionToAnotherInterfaceHoldsTheReferenceItAdded) {
  ScriptedObject object(true, true);
  const ISafeListenerRef ref(&object);
  {
    const IWeakReferenceCapableRef capable(ref);
    ASSERT_TRUE(capable != nullptr);
    EXPECT_EQ(static_cast<Tarn::IWeakReferenceCapable*>(&object), capable.get());
    EXPECT_EQ(2, object.Count());
  }
  EXPECT_EQ(1, object.Count());
}

TEST(InterfaceRef, ConversionToAnInterfaceTheObjectLacksIsNullAndReleasesWhatItAdded) {
  ScriptedObject object(true, false);
  const ISafeListenerRef ref(&object);
  const IWeakReferenceCapableRef capable(ref);
  EXPECT_TRUE(capable == nullptr);
  EXPECT_EQ(1, object.Count());
  EXPECT_EQ(1, object.mQueries);
}

TEST(InterfaceRef, ConversionOfANullReferenceIsNullAndAsksNothing) {
  const IWeakReferenceCapableRef capable{ISafeListenerRef()};
  EXPECT_TRUE(capable == nullptr);
}

// ---------------------------------------------------------------------------
// Interface identifiers

std::vector<std::uint8_t> BytesOf(const Tarn::IID& inIID) {
  std::vector<std::uint8_t> bytes(sizeof(Tarn::IID));
  std::memcpy(bytes.data(), &inIID, sizeof(Tarn::IID));
  return bytes;
}

TEST(InterfaceIdentifiers, AreStoredInTheUsualMixedEndianLayout) {
  static_assert(sizeof(Tarn::IID) == 16, "an interface identifier is 16 bytes");
  // {C51D0DEC-EFE2-48EE-8514-FAEB6D01C8F8}: the first three fields little-endian.
  EXPECT_EQ((std::vector<std::uint8_t>{0xEC, 0x0D, 0x1D, 0xC5, 0xE2, 0xEF, 0xEE, 0x48, 0x85, 0x14, 0xFA, 0xEB, 0x6D,
                                       0x01, 0xC8, 0xF8}),
            BytesOf(Tarn::IID_ISafeListener));
  // {F30494F3-AFD0-4490-94B8-0ED6670526FF}
  EXPECT_EQ((std::vector<std::uint8_t>{0xF3, 0x94, 0x04, 0xF3, 0xD0, 0xAF, 0x90, 0x44, 0x94, 0xB8, 0x0E, 0xD6, 0x67,
                                       0x05, 0x26, 0xFF}),
            BytesOf(Tarn::IID_IWeakReferenceCapable));
}

// ---------------------------------------------------------------------------
// SafeListenerBase

TEST(SafeListenerBase, FirstReferenceCountsOneAndTheLastDeletesTheObject) {
  const int liveBefore = CountedSafeListener::LiveCount();
  auto* object = new CountedSafeListener("object");
  ISafeListenerRef ref(object);
  EXPECT_EQ(1, object->RefCount());
  EXPECT_EQ(liveBefore + 1, CountedSafeListener::LiveCount());
  const boost::shared_ptr<Tarn::WeakReference> block = object->GetWeakReference();
  ref = nullptr;
  EXPECT_EQ(liveBefore, CountedSafeListener::LiveCount());
  EXPECT_LT(block->mRefCount.load(), 0);  // dead, and the block outlives the object
}

TEST(SafeListenerBase, AnswersBothInterfacesAndRefusesOthers) {
  ISafeListenerRef ref(new CountedSafeListener("object"));
  void* out = &out;
  EXPECT_EQ(Tarn::kNoInterface, ref->QueryInterface(Tarn::IID{1, 2, 3, {4, 5, 6, 7, 8, 9, 10, 11}}, &out));
  EXPECT_EQ(nullptr, out);
  EXPECT_TRUE(IWeakReferenceCapableRef(ref) != nullptr);
}

// ---------------------------------------------------------------------------
// Handles and resolution

TEST(SafeListenerHandle, HandleIsTheObjectsWeakReferenceBlockWhicheverReferenceGivesIt) {
  auto* object = new CountedSafeListener("object");
  const ISafeListenerRef first(object);
  const ISafeListenerRef second(first);
  const boost::shared_ptr<Tarn::WeakReference> handle = Tarn::GetSafeListenerHandle(first);
  EXPECT_EQ(object->GetWeakReference().get(), handle.get());
  EXPECT_EQ(handle.get(), Tarn::GetSafeListenerHandle(second).get());
  EXPECT_EQ(2, object->RefCount());  // no reference stays behind
}

TEST(SafeListenerHandle, NullReferenceOrObjectWithoutWeakReferenceGivesAnEmptyHandle) {
  EXPECT_FALSE(Tarn::GetSafeListenerHandle(ISafeListenerRef()));
  ScriptedObject object(true, false);
  const ISafeListenerRef ref(&object);
  EXPECT_FALSE(Tarn::GetSafeListenerHandle(ref));
  EXPECT_EQ(1, object.Count());
}

TEST(SafeListenerResolution, LiveObjectResolvesToAReferenceOwnedByTheResult) {
  auto* object = new CountedSafeListener("object");
  const ISafeListenerRef ref(object);
  {
    const ISafeListenerRef resolved = Tarn::ResolveSafeListener(object->GetWeakReference());
    EXPECT_EQ(static_cast<Tarn::ISafeListener*>(object), resolved.get());
    EXPECT_EQ(2, object->RefCount());
  }
  EXPECT_EQ(1, object->RefCount());
}

TEST(SafeListenerResolution, DeadObjectResolvesToNullAndStaysDead) {
  auto* object = new CountedSafeListener("object");
  ISafeListenerRef ref(object);
  const boost::shared_ptr<Tarn::WeakReference> handle = object->GetWeakReference();
  const int liveBefore = CountedSafeListener::LiveCount();
  ref = nullptr;
  ASSERT_EQ(liveBefore - 1, CountedSafeListener::LiveCount());
  // Failed resolutions leave their increments in the count; it must stay
  // negative however many there are.
  for (int i = 0; i < 100000; ++i) ASSERT_TRUE(Tarn::ResolveSafeListener(handle) == nullptr) << i;
  EXPECT_LT(handle->mRefCount.load(), 0);
}

TEST(SafeListenerResolution, EmptyHandleResolvesToNull) {
  EXPECT_TRUE(Tarn::ResolveSafeListener(boost::shared_ptr<Tarn::WeakReference>()) == nullptr);
}

TEST(SafeListenerResolution, ObjectRefusingISafeListenerResolvesToNullAndGetsItsReferenceBack) {
  ScriptedObject object(false, true);
  const ISafeListenerRef ref(&object);
  EXPECT_TRUE(Tarn::ResolveSafeListener(object.GetWeakReference()) == nullptr);
  EXPECT_EQ(1, object.Count());
}

// ---------------------------------------------------------------------------
// A broadcaster holding safe listeners

class BroadcasterWithSafeListeners : public ::testing::Test {
protected:
  MainThreadGuard mMainThread;
  CallLog mLog;
  Tarn::Broadcaster mBroadcaster;
};

TEST_F(BroadcasterWithSafeListeners, RegistrationHoldsTheWeakReferenceButNoReference) {
  auto* object = new CountedSafeListener("safe", &mLog);
  const ISafeListenerRef ref(object);
  mBroadcaster.AddListener(ref);
  EXPECT_EQ(1, object->RefCount());
  EXPECT_EQ(1, OtherBlockHolders(*object));
  mBroadcaster.BroadcastMessage(NumberMessage(1));
  EXPECT_EQ(std::vector<std::string>{"safe:1"}, mLog.Entries());
  EXPECT_EQ(1, object->RefCount());
  mBroadcaster.RemoveListener(ref);
  EXPECT_EQ(0, OtherBlockHolders(*object));
}

TEST_F(BroadcasterWithSafeListeners, ListenerDestroyedWhileRegisteredIsNotCalledAndIsPruned) {
  const int liveBefore = CountedSafeListener::LiveCount();
  ISafeListenerRef ref(new CountedSafeListener("safe", &mLog));
  mBroadcaster.AddListener(ref);
  ref = nullptr;  // the host's last reference: the broadcaster does not keep it alive
  EXPECT_EQ(liveBefore, CountedSafeListener::LiveCount());
  EXPECT_TRUE(mBroadcaster.HasListeners());
  mBroadcaster.BroadcastMessage(NumberMessage(1));
  EXPECT_TRUE(mLog.Entries().empty());
  EXPECT_FALSE(mBroadcaster.HasListeners());
}

TEST_F(BroadcasterWithSafeListeners, DeadListenerBetweenLiveOnesIsSkippedAndTheOthersServedInOrder) {
  const ISafeListenerRef first(new CountedSafeListener("first", &mLog));
  ISafeListenerRef middle(new CountedSafeListener("middle", &mLog));
  const ISafeListenerRef last(new CountedSafeListener("last", &mLog));
  mBroadcaster.AddListener(first);
  mBroadcaster.AddListener(middle);
  mBroadcaster.AddListener(last);
  middle = nullptr;
  mBroadcaster.BroadcastMessage(NumberMessage(1));
  mBroadcaster.RemoveListener(first);
  mBroadcaster.RemoveListener(last);
  EXPECT_EQ((std::vector<std::string>{"last:1", "first:1"}), mLog.Entries());
  EXPECT_FALSE(mBroadcaster.HasListeners());  // the dead entry was pruned on the way
}

TEST_F(BroadcasterWithSafeListeners, SecondReferenceToTheSameObjectDenotesTheSameRegistration) {
  auto* object = new CountedSafeListener("safe", &mLog);
  const ISafeListenerRef first(object);
  const ISafeListenerRef second(first);
  mBroadcaster.AddListener(first);
  mBroadcaster.AddListener(second);  // already registered: nothing changes
  mBroadcaster.BroadcastMessage(NumberMessage(1));
  EXPECT_EQ(std::vector<std::string>{"safe:1"}, mLog.Entries());
  mBroadcaster.RemoveListener(second);
  EXPECT_FALSE(mBroadcaster.HasListeners());
}

TEST_F(BroadcasterWithSafeListeners, RemovingAnUnregisteredListenerChangesNothing) {
  const ISafeListenerRef registered(new CountedSafeListener("registered", &mLog));
  const ISafeListenerRef stranger(new CountedSafeListener("stranger", &mLog));
  mBroadcaster.AddListener(registered);
  mBroadcaster.RemoveListener(stranger);
  mBroadcaster.BroadcastMessage(NumberMessage(1));
  EXPECT_EQ(std::vector<std::string>{"registered:1"}, mLog.Entries());
}

TEST_F(BroadcasterWithSafeListeners, ListenerHoldsAnExtraReferenceForItsWholeDelivery) {
  auto* object = new CountedSafeListener("safe");
  const ISafeListenerRef ref(object);
  std::int32_t countDuringDelivery = 0;
  object->SetAction([&](const Tarn::Message&) { countDuringDelivery = object->RefCount(); });
  mBroadcaster.AddListener(ref);
  mBroadcaster.BroadcastMessage(PingMessage());
  EXPECT_EQ(2, countDuringDelivery);
  EXPECT_EQ(1, object->RefCount());
}

TEST_F(BroadcasterWithSafeListeners, ListenerReleasingItsLastOwnerInItsHandlerIsDeletedOnlyAfterItReturns) {
  auto* object = new CountedSafeListener("safe");
  const std::shared_ptr<messaging_test::CallRecorder::Probe> probe = object->GetProbe();
  ISafeListenerRef ref(object);
  bool aliveAfterRelease = false;
  object->SetAction([&](const Tarn::Message&) {
    ref = nullptr;
    aliveAfterRelease = !probe->mDestroyed.load();
  });
  mBroadcaster.AddListener(ref);
  mBroadcaster.BroadcastMessage(PingMessage());
  EXPECT_TRUE(aliveAfterRelease);
  EXPECT_TRUE(probe->mDestroyed.load());
  mBroadcaster.BroadcastMessage(PingMessage());
  EXPECT_EQ(1, probe->mCalls.load());
  EXPECT_FALSE(mBroadcaster.HasListeners());
}

TEST_F(BroadcasterWithSafeListeners, ObjectRefusingISafeListenerIsNeverCalledAndItsRegistrationIsPruned) {
  ScriptedObject object(false, true);
  {
    const ISafeListenerRef ref(&object);
    mBroadcaster.AddListener(ref);
    EXPECT_TRUE(mBroadcaster.HasListeners());
    mBroadcaster.BroadcastMessage(PingMessage());
  }
  EXPECT_EQ(0, object.mCalls);
  EXPECT_EQ(0, object.Count());
  EXPECT_FALSE(mBroadcaster.HasListeners());
}

TEST_F(BroadcasterWithSafeListeners, ThrowingHandlerGetsItsDeliveryReferenceBack) {
  messaging_test::ExceptionRecorder exceptions;
  auto* object = new CountedSafeListener("safe");
  const ISafeListenerRef ref(object);
  object->SetAction([](const Tarn::Message&) { throw std::runtime_error("refused"); });
  mBroadcaster.AddListener(ref);
  mBroadcaster.BroadcastMessage(PingMessage());
  EXPECT_EQ(std::vector<std::string>{"refused"}, exceptions.Messages());
  EXPECT_EQ(1, object->RefCount());
}

TEST_F(BroadcasterWithSafeListeners, DestroyedBroadcasterLetsGoOfTheWeakReference) {
  auto* object = new CountedSafeListener("safe");
  const ISafeListenerRef ref(object);
  {
    Tarn::Broadcaster broadcaster;
    broadcaster.AddListener(ref);
    EXPECT_EQ(1, OtherBlockHolders(*object));
  }
  EXPECT_EQ(0, OtherBlockHolders(*object));
  EXPECT_EQ(1, object->RefCount());
}

}  // namespace
