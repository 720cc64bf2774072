// Messages: the ID hash, IDs of types (internal linkage included), Is/As,
// Clone and the posted copy that CreateCallback makes.
#include "TestSupport.h"

#include <TarnMessaging.h>

#include <boost/function.hpp>

#include <optional>
#include <set>
#include <stdexcept>
#include <typeinfo>

const Tarn::Message& OtherUnitProgress();  // MessageOtherUnit.cpp

namespace {

using kivcore::utility::SmallBlockAllocator;
using messaging_test::NumberMessage;

// Same name as the type in MessageOtherUnit.cpp, another layout.
struct Progress : Tarn::MessageImpl<Progress> {
  int mDone = 3;
};

// Holds a share of mToken, so that its destruction shows.
struct Tracked : Tarn::MessageImpl<Tracked> {
  std::shared_ptr<int> mToken = std::make_shared<int>(0);
};

// A message whose copy fails, as one holding a resource that runs out would.
struct Uncopyable : Tarn::MessageImpl<Uncopyable> {
  Uncopyable() = default;
  Uncopyable(const Uncopyable& inOther) : Tarn::MessageImpl<Uncopyable>(inOther) { throw std::runtime_error("copy"); }
};

std::size_t BlocksInUse() { return SmallBlockAllocator::GetStatistics().blocksInUse; }

TEST(MessageID, TheHashMultipliesByFiveAddsEachByteAsSignedAndWraps) {
  EXPECT_EQ(Tarn::HashMessageTypeNameToMessageID("abc"), 3014u);
  EXPECT_EQ(Tarn::HashMessageTypeNameToMessageID("\x41\xE9"), 302u);
  EXPECT_EQ(Tarn::HashMessageTypeNameToMessageID("abcdefghijklmnop"), 3236314344u);
}

TEST(MessageID, ATypeWithExternalLinkageIsKnownByTheHashOfItsNameAndIsAsMatchOnlyIt) {
  EXPECT_EQ(NumberMessage::StaticMessageID(), Tarn::HashMessageTypeNameToMessageID(typeid(NumberMessage).name()));
  const NumberMessage copy(NumberMessage(4));
  const Tarn::Message& message = copy;
  EXPECT_EQ(message.GetMessageID(), NumberMessage(9).GetMessageID());
  EXPECT_TRUE(message.Is<NumberMessage>() && !message.Is<messaging_test::PingMessage>());
  ASSERT_EQ(message.As<NumberMessage>(), &copy);
  EXPECT_EQ(message.As<NumberMessage>()->mValue, 4);
  EXPECT_EQ(message.As<messaging_test::PingMessage>(), nullptr);
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
  // Optional storage, not the heap, so that a stale link would still read
  // the dead record's ID.
  std::optional<Tarn::Detail::LocalMessageType> first, second, third;
  first.emplace(name);
  second.emplace(name);
  third.emplace(name);  // listed third, second, first
  EXPECT_EQ(first->GetMessageID(), Tarn::HashMessageTypeNameToMessageID(name));
  const std::set<Tarn::MessageID> ids = {first->GetMessageID(), second->GetMessageID(), third->GetMessageID()};
  EXPECT_EQ(ids.size(), 3u);
  second.reset();  // from the middle: the first record's back-link must follow
  first.reset();
  third.emplace(name);
  EXPECT_EQ(third->GetMessageID(), Tarn::HashMessageTypeNameToMessageID(name));
  // Modules loaded on two threads at once list their types at once: each
  // record still gets an ID of its own, and each leaves the list whole.
  std::vector<Tarn::MessageID> loaded[2];
  messaging_test::Latch started(2), listed(2);
  messaging_test::ThreadGroup modules;
  for (auto& ids : loaded) {
    modules.Start([&, name] {
      std::vector<std::unique_ptr<Tarn::Detail::LocalMessageType>> types;
      started.CountDown();
      ASSERT_TRUE(started.WaitFor());
      for (int type = 0; type < 200; ++type) types.push_back(std::make_unique<Tarn::Detail::LocalMessageType>(name));
      for (const auto& type : types) ids.push_back(type->GetMessageID());
      listed.CountDown();
      ASSERT_TRUE(listed.WaitFor());  // then both unload at once
    });
  }
  modules.JoinAll();
  std::set<Tarn::MessageID> distinct{third->GetMessageID()};
  for (const auto& ids : loaded) distinct.insert(ids.begin(), ids.end());
  EXPECT_EQ(distinct.size(), 401u);
}

TEST(MessageClone, ACloneAndACloneOfItAreCopiesInOneExactBlockEachThatDeleteReturns) {
  const auto before = SmallBlockAllocator::GetStatistics().bytesInUse;
  Tarn::Message* clone = NumberMessage(-7).Clone();
  Tarn::Message* cloneOfClone = clone->Clone();
  EXPECT_EQ(SmallBlockAllocator::GetStatistics().bytesInUse,
            before + 2 * sizeof(Tarn::DynamicallyAllocatedMessage<NumberMessage>));
  for (Tarn::Message* copy : {clone, cloneOfClone}) {
    EXPECT_NE(dynamic_cast<Tarn::DynamicallyAllocatedMessage<NumberMessage>*>(copy), nullptr);
    EXPECT_EQ(copy->As<NumberMessage>()->mValue, -7);
    delete copy;
  }
  EXPECT_EQ(SmallBlockAllocator::GetStatistics().bytesInUse, before);
}

TEST(MessageCallback, ACallbackCarriesACopyTakenWhenMadeInOneBlockFreedWithItsLastCopy) {
  messaging_test::MainThreadGuard mainThread;
  Tarn::Messaging::Initialize();
  messaging_test::CallLog log;
  messaging_test::RecordingListener sink("sink", &log);
  Tarn::StationUtils::AddListener(Tarn::kStation_StatusBar, &sink);
  // The station's own storage, made on its first broadcast, is not counted.
  Tarn::StationUtils::BroadcastMessage(Tarn::kStation_StatusBar, messaging_test::PingMessage());
  const std::size_t blocksBefore = BlocksInUse();
  const Tracked tracked;
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
    const boost::function<void()> neverRun = tracked.CreateCallback(Tarn::kStation_StatusBar);
    EXPECT_EQ(tracked.mToken.use_count(), 2);
    // A copy that throws leaves no block behind.
    EXPECT_THROW(Uncopyable().CreateCallback(Tarn::kStation_StatusBar), std::runtime_error);
  }
  EXPECT_EQ(tracked.mToken.use_count(), 1) << "the posted copy was never destroyed";
  EXPECT_EQ(BlocksInUse(), blocksBefore) << "the posted copies' block was not returned";
  EXPECT_EQ(log.Entries(), (std::vector<std::string>{"sink:ping", "sink:1", "sink:1"}));
  // A callback whose station is gone when it runs delivers nothing.
  const boost::function<void()> late = NumberMessage(3).CreateCallback(Tarn::kStation_StatusBar);
  Tarn::Messaging::Terminate();
  late();
  EXPECT_EQ(log.Entries().size(), 3u);
}

}  // namespace
