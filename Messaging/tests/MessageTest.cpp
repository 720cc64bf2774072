// Messages: the ID hash, IDs of types (internal linkage included), Is/As,
// Clone and the posted copy that CreateCallback makes.
#include "TestSupport.h"

#include <TarnMessaging.h>

#include <boost/function.hpp>

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <typeinfo>

const Tarn::Message& OtherUnitProgress();  // MessageOtherUnit.cpp

namespace {

using kivcore::utility::SmallBlockAllocator;
using messaging_test::NumberMessage;
using messaging_test::PingMessage;

// Same name as the type in MessageOtherUnit.cpp, another layout.
struct Progress : Tarn::MessageImpl<Progress> {
  int mDone = 3;
};

struct Wide : Tarn::MessageImpl<Wide> {
  Wide(char inA, long long inB, double inC) : mA(inA), mB(inB), mC(inC) {}
  char mA;
  long long mB;
  double mC;
};

std::size_t BlocksInUse() { return SmallBlockAllocator::GetStatistics().blocksInUse; }

TEST(MessageID, TheHashMultipliesByFiveAddsEachByteAsSignedAndWraps) {
  EXPECT_EQ(Tarn::HashMessageTypeNameToMessageID(""), 0u);
  EXPECT_EQ(Tarn::HashMessageTypeNameToMessageID("a"), 97u);
  EXPECT_EQ(Tarn::HashMessageTypeNameToMessageID("abc"), 3014u);
  EXPECT_EQ(Tarn::HashMessageTypeNameToMessageID("\x41\xE9"), 302u);
  EXPECT_EQ(Tarn::HashMessageTypeNameToMessageID("\xFF"), 4294967295u);
  EXPECT_EQ(Tarn::HashMessageTypeNameToMessageID("abcdefghijklmnop"), 3236314344u);
}

TEST(MessageID, ATypeWithExternalLinkageIsKnownByTheHashOfItsNameAndIsAsMatchOnlyIt) {
  EXPECT_EQ(NumberMessage::StaticMessageID(), Tarn::HashMessageTypeNameToMessageID(typeid(NumberMessage).name()));
  EXPECT_EQ(Tarn::IdleCountdownTimerMessage::StaticMessageID(),
            Tarn::HashMessageTypeNameToMessageID(typeid(Tarn::IdleCountdownTimerMessage).name()));
  const NumberMessage number(4);
  const NumberMessage copy(number);
  const Tarn::Message& message = copy;
  EXPECT_EQ(message.GetMessageID(), NumberMessage(9).GetMessageID());
  EXPECT_TRUE(message.Is<NumberMessage>());
  EXPECT_FALSE(message.Is<PingMessage>());
  ASSERT_EQ(message.As<NumberMessage>(), &copy);
  EXPECT_EQ(message.As<NumberMessage>()->mValue, 4);
  EXPECT_EQ(message.As<PingMessage>(), nullptr);
}

// Two types of one name in the anonymous namespaces of two sources had one
// ID, so a listener cast the one to the layout of the other.
TEST(MessageID, TypesOfOneNameInTheAnonymousNamespacesOfTwoSourcesGetDistinctIDs) {
  const Tarn::Message& other = OtherUnitProgress();
  const Progress mine;
  ASSERT_STREQ(typeid(other).name(), typeid(mine).name());
  EXPECT_NE(other.GetMessageID(), mine.GetMessageID());
  EXPECT_EQ(other.As<Progress>(), nullptr);
  EXPECT_EQ(Progress::StaticMessageID(), mine.GetMessageID());
  // The records behind such IDs: the first of a name keeps its hash, a
  // later one steps aside, and a record gone frees its ID.
  const char* const name = "N12_GLOBAL__N_18SolitaryE";
  ASSERT_TRUE(Tarn::Detail::HasInternalLinkage(name));
  EXPECT_FALSE(Tarn::Detail::HasInternalLinkage(typeid(NumberMessage).name()));
  auto first = std::make_unique<Tarn::Detail::LocalMessageType>(name);
  const Tarn::Detail::LocalMessageType second(name);
  EXPECT_EQ(first->GetMessageID(), Tarn::HashMessageTypeNameToMessageID(name));
  EXPECT_NE(second.GetMessageID(), first->GetMessageID());
  first.reset();
  const Tarn::Detail::LocalMessageType third(name);
  EXPECT_EQ(third.GetMessageID(), Tarn::HashMessageTypeNameToMessageID(name));
}

TEST(MessageClone, ACloneCopiesEveryParameterIntoOneExactBlockThatDeleteReturns) {
  const Wide source('x', -5000000000LL, 2.5);
  const auto before = SmallBlockAllocator::GetStatistics();
  Tarn::Message* clone = source.Clone();
  EXPECT_EQ(SmallBlockAllocator::GetStatistics().bytesInUse,
            before.bytesInUse + sizeof(Tarn::DynamicallyAllocatedMessage<Wide>));
  Tarn::Message* cloneOfClone = clone->Clone();
  for (Tarn::Message* copy : {clone, cloneOfClone}) {
    ASSERT_NE(dynamic_cast<Tarn::DynamicallyAllocatedMessage<Wide>*>(copy), nullptr);
    const Wide& wide = *copy->As<Wide>();
    EXPECT_EQ(wide.mA, 'x');
    EXPECT_EQ(wide.mB, -5000000000LL);
    EXPECT_EQ(wide.mC, 2.5);
  }
  delete clone;
  delete cloneOfClone;
  EXPECT_EQ(SmallBlockAllocator::GetStatistics().bytesInUse, before.bytesInUse);
}

// Records the numbers it hears.
struct NumberSink : Tarn::Listener {
  void ListenToMessage(const Tarn::Message& inMessage) override {
    if (const auto* number = inMessage.As<NumberMessage>()) mHeard.push_back(number->mValue);
  }
  std::vector<int> mHeard;
};

TEST(MessageCallback, ACallbackCarriesACopyTakenWhenMadeInOneBlockFreedWithItsLastCopy) {
  messaging_test::MainThreadGuard mainThread;
  Tarn::Messaging::Initialize();
  NumberSink sink;
  Tarn::StationUtils::AddListener(Tarn::kStation_StatusBar, &sink);
  Tarn::StationUtils::BroadcastMessage(Tarn::kStation_StatusBar, PingMessage());  // the station's own first-use storage
  const std::size_t blocksBefore = BlocksInUse();
  {
    NumberMessage message(1);
    const boost::function<void()> callback = message.CreateCallback(Tarn::kStation_StatusBar);
    EXPECT_EQ(BlocksInUse(), blocksBefore + 1);
    message.mValue = 2;
    boost::function<void()> copy = callback;
    copy();
    callback();
    copy.clear();
    EXPECT_EQ(BlocksInUse(), blocksBefore + 1);
    const boost::function<void()> neverRun = PingMessage().CreateCallback(Tarn::kStation_StatusBar);
  }
  EXPECT_EQ(BlocksInUse(), blocksBefore);
  EXPECT_EQ(sink.mHeard, (std::vector<int>{1, 1}));
  // A callback whose station is gone when it runs delivers nothing.
  const boost::function<void()> late = NumberMessage(3).CreateCallback(Tarn::kStation_StatusBar);
  Tarn::Messaging::Terminate();
  late();
  EXPECT_EQ(sink.mHeard.size(), 2u);
}

}  // namespace
