// Message identity (the type-name hash and the per-type ID) and heap copies
// (Clone), including what a copy costs the small-block allocator.
#include "TestSupport.h"

#include <TarnMessaging/Message.h>
#include <TarnMessaging/MessageImpl.h>

#include <kivcore/SmallBlockAllocator.h>

#include <gtest/gtest.h>

#include <memory>
#include <new>
#include <typeinfo>

using kivcore::utility::SmallBlockAllocator;
using messaging_test::NumberMessage;
using messaging_test::PingMessage;
using messaging_test::SmallBlockFailureGuard;

namespace alpha {
struct Twin : Tarn::MessageImpl<Twin> {};
}  // namespace alpha
namespace beta {
struct Twin : Tarn::MessageImpl<Twin> {};
}  // namespace beta

namespace {

// A message with the largest number of parameters message types have, of
// mixed plain types, to see that a copy takes every one of them.
struct SevenValues : Tarn::MessageImpl<SevenValues> {
  SevenValues(char inA, short inB, int inC, long long inD, unsigned inE, double inF, bool inG)
      : mA(inA), mB(inB), mC(inC), mD(inD), mE(inE), mF(inF), mG(inG) {}
  char mA;
  short mB;
  int mC;
  long long mD;
  unsigned mE;
  double mF;
  bool mG;
};

// Ends a Clone with delete through Message*, as its owners do.
using MessagePtr = std::unique_ptr<Tarn::Message>;

// ---------------------------------------------------------------------------
// The hash

TEST(MessageIdHash, EmptyNameHashesToZero) { EXPECT_EQ(0u, Tarn::HashMessageTypeNameToMessageID("")); }

TEST(MessageIdHash, SingleLetterHashesToItsCode) { EXPECT_EQ(97u, Tarn::HashMessageTypeNameToMessageID("a")); }

TEST(MessageIdHash, EachByteMultipliesThePreviousValueByFive) {
  EXPECT_EQ(3014u, Tarn::HashMessageTypeNameToMessageID("abc"));
}

TEST(MessageIdHash, HighBytesCountAsNegative) {
  // 65 * 5 + (0xE9 - 256): the byte lowers the value; unsigned bytes would give 558.
  EXPECT_EQ(302u, Tarn::HashMessageTypeNameToMessageID("\x41\xE9"));
  EXPECT_EQ(4294967295u, Tarn::HashMessageTypeNameToMessageID("\xFF"));
}

TEST(MessageIdHash, LongNamesWrapModuloTwoToThe32) {
  EXPECT_EQ(3236314344u, Tarn::HashMessageTypeNameToMessageID("abcdefghijklmnop"));
}

// ---------------------------------------------------------------------------
// Type IDs

TEST(MessageId, TypeIdIsTheHashOfTheDecoratedTypeName) {
  EXPECT_EQ(Tarn::HashMessageTypeNameToMessageID(typeid(NumberMessage).name()), NumberMessage::StaticMessageID());
}

TEST(MessageId, StaticMessageIdIsTheSameOnEveryCall) {
  const Tarn::MessageID first = SevenValues::StaticMessageID();
  EXPECT_NE(0u, first);
  EXPECT_EQ(first, SevenValues::StaticMessageID());
}

TEST(MessageId, MessagesOfOneTypeShareTheIdWhateverTheirContents) {
  const NumberMessage one(1);
  const NumberMessage two(2);
  EXPECT_EQ(NumberMessage::StaticMessageID(), one.GetMessageID());
  EXPECT_EQ(one.GetMessageID(), two.GetMessageID());
}

TEST(MessageId, DifferentTypesHaveDifferentIds) {
  EXPECT_NE(PingMessage::StaticMessageID(), NumberMessage::StaticMessageID());
  EXPECT_NE(PingMessage().GetMessageID(), NumberMessage(0).GetMessageID());
}

TEST(MessageId, SameClassNameInDifferentNamespacesGivesDifferentIds) {
  EXPECT_NE(alpha::Twin::StaticMessageID(), beta::Twin::StaticMessageID());
  EXPECT_NE(alpha::Twin().GetMessageID(), beta::Twin().GetMessageID());
}

TEST(MessageId, CopyHasTheIdOfItsSource) {
  const NumberMessage source(7);
  const NumberMessage copy(source);
  EXPECT_EQ(source.GetMessageID(), copy.GetMessageID());
  EXPECT_EQ(7, copy.mValue);
}

// The way listeners recognise messages: the first ID test that matches wins,
// and a message no test matches is ignored.
TEST(MessageId, ListenerIgnoresMessagesOfTypesItDoesNotHandle) {
  struct NumberOnlyListener : Tarn::Listener {
    void ListenToMessage(const Tarn::Message& inMessage) override {
      if (inMessage.GetMessageID() == NumberMessage::StaticMessageID())
        mSum += static_cast<const NumberMessage&>(inMessage).mValue;
    }
    int mSum = 0;
  } listener;
  listener.ProcessMessage(NumberMessage(4));
  listener.ProcessMessage(PingMessage());
  listener.ProcessMessage(alpha::Twin());
  listener.ProcessMessage(NumberMessage(5));
  EXPECT_EQ(9, listener.mSum);
}

// ---------------------------------------------------------------------------
// Clone

TEST(MessageClone, CloneHasTheTypeIdAndEveryParameterOfItsSource) {
  const SevenValues source('x', -3, 40000, -5000000000LL, 4000000000u, 2.5, true);
  const MessagePtr clone(source.Clone());
  ASSERT_NE(nullptr, clone);
  EXPECT_EQ(SevenValues::StaticMessageID(), clone->GetMessageID());
  const auto& copy = static_cast<const SevenValues&>(*clone);
  EXPECT_EQ('x', copy.mA);
  EXPECT_EQ(-3, copy.mB);
  EXPECT_EQ(40000, copy.mC);
  EXPECT_EQ(-5000000000LL, copy.mD);
  EXPECT_EQ(4000000000u, copy.mE);
  EXPECT_EQ(2.5, copy.mF);
  EXPECT_TRUE(copy.mG);
}

TEST(MessageClone, CloneIsADynamicallyAllocatedMessageOfTheSourceType) {
  const NumberMessage source(3);
  const MessagePtr clone(source.Clone());
  EXPECT_NE(nullptr, dynamic_cast<const Tarn::DynamicallyAllocatedMessage<NumberMessage>*>(clone.get()));
  EXPECT_NE(static_cast<const Tarn::Message*>(&source), clone.get());
}

TEST(MessageClone, CloneOfACloneIsAnotherCopyOfTheSameType) {
  const NumberMessage source(11);
  const MessagePtr first(source.Clone());
  const MessagePtr second(first->Clone());
  EXPECT_NE(first.get(), second.get());
  EXPECT_NE(nullptr, dynamic_cast<const Tarn::DynamicallyAllocatedMessage<NumberMessage>*>(second.get()));
  EXPECT_EQ(NumberMessage::StaticMessageID(), second->GetMessageID());
  EXPECT_EQ(11, static_cast<const NumberMessage&>(*second).mValue);
}

TEST(MessageClone, CloneOfAMessageWithoutParametersCarriesItsId) {
  const MessagePtr clone(PingMessage().Clone());
  EXPECT_EQ(PingMessage::StaticMessageID(), clone->GetMessageID());
}

TEST(MessageClone, CloneTakesOneSmallBlockOfExactlyItsSizeAndDeleteReturnsIt) {
  const SevenValues source('a', 1, 2, 3, 4u, 5.0, false);
  const SmallBlockAllocator::Statistics before = SmallBlockAllocator::GetStatistics();

  Tarn::Message* clone = source.Clone();
  const SmallBlockAllocator::Statistics during = SmallBlockAllocator::GetStatistics();
  EXPECT_EQ(before.allocations + 1, during.allocations);
  EXPECT_EQ(before.blocksInUse + 1, during.blocksInUse);
  EXPECT_EQ(before.bytesInUse + sizeof(Tarn::DynamicallyAllocatedMessage<SevenValues>), during.bytesInUse);

  delete clone;  // through Message*, as every owner of a clone does
  const SmallBlockAllocator::Statistics after = SmallBlockAllocator::GetStatistics();
  EXPECT_EQ(before.blocksInUse, after.blocksInUse);
  EXPECT_EQ(before.bytesInUse, after.bytesInUse);
}

TEST(MessageClone, CloneOfACloneReturnsItsBlockToo) {
  const SmallBlockAllocator::Statistics before = SmallBlockAllocator::GetStatistics();
  {
    const MessagePtr first(NumberMessage(1).Clone());
    const MessagePtr second(first->Clone());
    EXPECT_EQ(before.blocksInUse + 2, SmallBlockAllocator::GetStatistics().blocksInUse);
  }
  const SmallBlockAllocator::Statistics after = SmallBlockAllocator::GetStatistics();
  EXPECT_EQ(before.blocksInUse, after.blocksInUse);
  EXPECT_EQ(before.bytesInUse, after.bytesInUse);
}

TEST(MessageClone, CloneWithExhaustedStorageThrowsBadAllocAndLeavesNothingBehind) {
  const SevenValues source('a', 1, 2, 3, 4u, 5.0, false);
  const SmallBlockAllocator::Statistics before = SmallBlockAllocator::GetStatistics();
  {
    SmallBlockFailureGuard failEveryAllocation(0);
    EXPECT_THROW(static_cast<void>(MessagePtr(source.Clone())), std::bad_alloc);
  }
  const SmallBlockAllocator::Statistics after = SmallBlockAllocator::GetStatistics();
  EXPECT_EQ(before.allocations, after.allocations);
  EXPECT_EQ(before.blocksInUse, after.blocksInUse);
  EXPECT_EQ(before.bytesInUse, after.bytesInUse);
}

TEST(MessageClone, StorageThatRecoversServesTheNextClone) {
  const NumberMessage source(5);
  {
    SmallBlockFailureGuard failEveryAllocation(0);
    EXPECT_THROW(static_cast<void>(MessagePtr(source.Clone())), std::bad_alloc);
  }
  const MessagePtr clone(source.Clone());
  EXPECT_EQ(5, static_cast<const NumberMessage&>(*clone).mValue);
}

TEST(MessageClone, CloneIsIndependentOfItsSource) {
  NumberMessage source(1);
  const MessagePtr clone(source.Clone());
  source.mValue = 2;
  EXPECT_EQ(1, static_cast<const NumberMessage&>(*clone).mValue);
}

}  // namespace
