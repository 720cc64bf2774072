#include "TestSupport.h"

#include <kivcore/InitializerRegistry.h>

#include <gtest/gtest.h>

#include <memory>
#include <stdexcept>
#include <string>
#include <vector>

using namespace kivcore::config;
using kivcore::proplist::PropList;

namespace {

InitializerDependencies NoDependencies() { return InitializerDependencies{}; }

InitializerDependencies DependsOn(const char* inName) {
  InitializerDependencies dependencies{};
  dependencies[0] = inName;
  return dependencies;
}

// Registrars made by a test, and the log of what ran. Every registrar is
// withdrawn, after a final TerminateAll, when the test ends.
class InitializerRegistryTest : public ::testing::Test {
protected:
  void TearDown() override {
    InitializerRegistry::TerminateAll();
    mRegistrars.clear();
  }

  void Register(const char* inName, const InitializerDependencies& inDependencies = NoDependencies(),
                std::function<bool()> inInit = [] { return true; }) {
    mRegistrars.push_back(std::make_unique<InitializerRegistrar>(
        inName, EInitializerContextFlags(10),
        [this, name = std::string(inName), inInit](const PropList&) {
          mLog.push_back("init " + name);
          return inInit();
        },
        [this, name = std::string(inName)] { mLog.push_back("term " + name); }, inDependencies));
  }

  std::vector<std::unique_ptr<InitializerRegistrar>> mRegistrars;
  std::vector<std::string> mLog;
};

TEST_F(InitializerRegistryTest, NothingRunsUntilTheHostAsks) {
  Register("Lib::A");
  EXPECT_TRUE(mLog.empty());
  EXPECT_TRUE(InitializerRegistry::InitializeAll(PropList()));
  EXPECT_EQ((std::vector<std::string>{"init Lib::A"}), mLog);
}

TEST_F(InitializerRegistryTest, InitializersRunInRegistrationOrderAndTerminateInReverse) {
  Register("Lib::A");
  Register("Lib::B");
  Register("Lib::C");
  EXPECT_TRUE(InitializerRegistry::InitializeAll(PropList()));
  InitializerRegistry::TerminateAll();
  EXPECT_EQ((std::vector<std::string>{"init Lib::A", "init Lib::B", "init Lib::C", "term Lib::C", "term Lib::B",
                                      "term Lib::A"}),
            mLog);
}

TEST_F(InitializerRegistryTest, DependencyRegisteredLaterRunsFirstAndTerminatesLast) {
  Register("Lib::User", DependsOn("Lib::Base"));
  Register("Lib::Other");
  Register("Lib::Base");
  EXPECT_TRUE(InitializerRegistry::InitializeAll(PropList()));
  InitializerRegistry::TerminateAll();
  EXPECT_EQ((std::vector<std::string>{"init Lib::Other", "init Lib::Base", "init Lib::User", "term Lib::User",
                                      "term Lib::Base", "term Lib::Other"}),
            mLog);
}

TEST_F(InitializerRegistryTest, DependencyThatIsNotRegisteredIsIgnored) {
  Register("Lib::A", DependsOn("Lib::Missing"));
  EXPECT_TRUE(InitializerRegistry::InitializeAll(PropList()));
  EXPECT_EQ((std::vector<std::string>{"init Lib::A"}), mLog);
}

TEST_F(InitializerRegistryTest, DependencyCycleIsAFailureAndRunsNeither) {
  Register("Lib::A", DependsOn("Lib::B"));
  Register("Lib::B", DependsOn("Lib::A"));
  EXPECT_FALSE(InitializerRegistry::InitializeAll(PropList()));
  EXPECT_TRUE(mLog.empty());
}

TEST_F(InitializerRegistryTest, FailingInitializerStopsTheRunAndIsRetriedNextTime) {
  bool succeed = false;
  Register("Lib::A");
  Register("Lib::B", NoDependencies(), [&succeed] { return succeed; });
  Register("Lib::C");
  EXPECT_FALSE(InitializerRegistry::InitializeAll(PropList()));
  EXPECT_EQ((std::vector<std::string>{"init Lib::A", "init Lib::B"}), mLog);

  // Only what was initialized is terminated.
  InitializerRegistry::TerminateAll();
  EXPECT_EQ("term Lib::A", mLog.back());
  EXPECT_EQ(3u, mLog.size());

  mLog.clear();
  succeed = true;
  EXPECT_TRUE(InitializerRegistry::InitializeAll(PropList()));
  EXPECT_EQ((std::vector<std::string>{"init Lib::A", "init Lib::B", "init Lib::C"}), mLog);
}

TEST_F(InitializerRegistryTest, ThrowingInitializerCountsAsAFailure) {
  Register("Lib::A", NoDependencies(), []() -> bool { throw std::runtime_error("no"); });
  Register("Lib::B");
  EXPECT_FALSE(InitializerRegistry::InitializeAll(PropList()));
  EXPECT_EQ((std::vector<std::string>{"init Lib::A"}), mLog);
}

TEST_F(InitializerRegistryTest, InitializedEntriesRunOnlyOnceUntilTerminated) {
  Register("Lib::A");
  EXPECT_TRUE(InitializerRegistry::InitializeAll(PropList()));
  Register("Lib::B");
  EXPECT_TRUE(InitializerRegistry::InitializeAll(PropList()));
  InitializerRegistry::TerminateAll();
  InitializerRegistry::TerminateAll();
  EXPECT_TRUE(InitializerRegistry::InitializeAll(PropList()));
  EXPECT_EQ((std::vector<std::string>{"init Lib::A", "init Lib::B", "term Lib::B", "term Lib::A", "init Lib::A",
                                      "init Lib::B"}),
            mLog);
}

TEST_F(InitializerRegistryTest, InitializersReceiveTheHostsProperties) {
  std::string seen;
  InitializerRegistrar registrar(
      "Lib::Props", EInitializerContextFlags(0),
      [&seen](const PropList& inProperties) {
        seen = inProperties.Get("mode", "none");
        return true;
      },
      nullptr, NoDependencies());
  PropList properties;
  properties.Set("mode", "headless");
  EXPECT_TRUE(InitializerRegistry::InitializeAll(properties));
  EXPECT_EQ("headless", seen);
  InitializerRegistry::TerminateAll();
}

TEST_F(InitializerRegistryTest, RegistrationIsVisibleWithItsFlagsUntilWithdrawn) {
  unsigned int flags = 0;
  EXPECT_FALSE(InitializerRegistry::IsRegistered("Lib::Flagged"));
  {
    InitializerRegistrar registrar("Lib::Flagged", EInitializerContextFlags(10), nullptr, nullptr, NoDependencies());
    EXPECT_TRUE(InitializerRegistry::IsRegistered("Lib::Flagged", &flags));
    EXPECT_EQ(10u, flags);
  }
  EXPECT_FALSE(InitializerRegistry::IsRegistered("Lib::Flagged"));
}

TEST_F(InitializerRegistryTest, WithdrawnInitializerIsNeitherInitializedNorTerminated) {
  Register("Lib::A");
  Register("Lib::B");
  EXPECT_TRUE(InitializerRegistry::InitializeAll(PropList()));
  mRegistrars.back().reset();
  InitializerRegistry::TerminateAll();
  EXPECT_EQ((std::vector<std::string>{"init Lib::A", "init Lib::B", "term Lib::A"}), mLog);
}

// An initializer that loads a library registers new initializers while it
// runs; the registry's lock must not be held then, and the newcomer runs in
// the same pass.
TEST_F(InitializerRegistryTest, InitializerMayRegisterAnotherThatRunsInTheSamePass) {
  bool result = false;
  platform_test::ThreadGroup threads;
  threads.Start([&] {
    Register("Lib::Loader", NoDependencies(), [this] {
      Register("Lib::Loaded");
      return true;
    });
    result = InitializerRegistry::InitializeAll(PropList());
  });
  threads.JoinAll();
  EXPECT_TRUE(result);
  EXPECT_EQ((std::vector<std::string>{"init Lib::Loader", "init Lib::Loaded"}), mLog);
}

TEST_F(InitializerRegistryTest, AllTerminatorsRunEvenWhenOneThrows) {
  InitializerRegistrar first("Lib::First", EInitializerContextFlags(0), nullptr,
                             [this] { mLog.push_back("term Lib::First"); }, NoDependencies());
  InitializerRegistrar failing("Lib::Failing", EInitializerContextFlags(0), nullptr,
                               [] { throw std::runtime_error("teardown failed"); }, NoDependencies());
  InitializerRegistrar last("Lib::Last", EInitializerContextFlags(0), nullptr,
                            [this] { mLog.push_back("term Lib::Last"); }, NoDependencies());
  EXPECT_TRUE(InitializerRegistry::InitializeAll(PropList()));
  EXPECT_THROW(InitializerRegistry::TerminateAll(), std::runtime_error);
  EXPECT_EQ((std::vector<std::string>{"term Lib::Last", "term Lib::First"}), mLog);
}

}  // namespace
