#include <kivcore/InitializerRegistry.h>

#include <gtest/gtest.h>

#include <memory>
#include <stdexcept>
#include <string>
#include <vector>

using namespace kivcore::config;
using kivcore::proplist::PropList;

namespace {

// Registrars made by a test, and the log of what ran. Every registrar is
// withdrawn, after a final TerminateAll, when the test ends.
class InitializerRegistryTest : public ::testing::Test {
protected:
  void TearDown() override {
    InitializerRegistry::TerminateAll();
    mRegistrars.clear();
  }

  void Register(const char* inName, const char* inDependency = nullptr,
                std::function<bool(const PropList&)> inInit = [](const PropList&) { return true; },
                std::function<void()> inTerminate = [] {}) {
    InitializerDependencies dependencies{};
    dependencies[0] = inDependency;
    mRegistrars.push_back(std::make_unique<InitializerRegistrar>(
        inName, EInitializerContextFlags(10),
        [this, name = std::string(inName), inInit](const PropList& inProperties) {
          mLog.push_back("init " + name);
          return inInit(inProperties);
        },
        [this, name = std::string(inName), inTerminate] {
          mLog.push_back("term " + name);
          inTerminate();
        },
        dependencies));
  }

  std::vector<std::unique_ptr<InitializerRegistrar>> mRegistrars;
  std::vector<std::string> mLog;
};

TEST_F(InitializerRegistryTest, DependenciesRunFirstAndTerminationRunsInReverseOrder) {
  Register("Lib::User", "Lib::Base");
  Register("Lib::Other", "Lib::NotRegistered");
  Register("Lib::Base", nullptr, [](const PropList& inProperties) { return inProperties.Get("mode") == "headless"; });
  EXPECT_TRUE(mLog.empty()) << "nothing runs until the host asks";
  unsigned int flags = 0;
  EXPECT_TRUE(InitializerRegistry::IsRegistered("Lib::Base", &flags));
  EXPECT_EQ(10u, flags);
  PropList properties;
  properties.Set("mode", "headless");
  EXPECT_TRUE(InitializerRegistry::InitializeAll(properties));
  EXPECT_TRUE(InitializerRegistry::InitializeAll(properties)) << "initialized entries do not run again";
  InitializerRegistry::TerminateAll();
  InitializerRegistry::TerminateAll();
  EXPECT_EQ((std::vector<std::string>{"init Lib::Other", "init Lib::Base", "init Lib::User", "term Lib::User",
                                      "term Lib::Base", "term Lib::Other"}),
            mLog);
}

TEST_F(InitializerRegistryTest, FailuresStopTheRunAndOnlyWhatWasInitializedIsTerminated) {
  bool succeed = false;
  Register("Lib::A", nullptr, [](const PropList&) { return true; },
           [] { throw std::runtime_error("teardown failed"); });
  Register("Lib::B", nullptr, [&succeed](const PropList&) { return succeed; });
  Register("Lib::C", nullptr, [](const PropList&) -> bool { throw std::runtime_error("no"); });
  Register("Lib::D");
  EXPECT_FALSE(InitializerRegistry::InitializeAll(PropList()));
  succeed = true;
  EXPECT_FALSE(InitializerRegistry::InitializeAll(PropList())) << "a throwing init is a failure";
  mRegistrars[2].reset();
  EXPECT_TRUE(InitializerRegistry::InitializeAll(PropList()));
  mRegistrars[3].reset();
  // A throwing terminator does not keep the others from running.
  EXPECT_THROW(InitializerRegistry::TerminateAll(), std::runtime_error);
  EXPECT_EQ((std::vector<std::string>{"init Lib::A", "init Lib::B", "init Lib::B", "init Lib::C", "init Lib::D",
                                      "term Lib::B", "term Lib::A"}),
            mLog);
  EXPECT_FALSE(InitializerRegistry::IsRegistered("Lib::D"));

  // A cycle fails and runs neither side.
  mRegistrars.clear();
  mLog.clear();
  Register("Lib::Egg", "Lib::Hen");
  Register("Lib::Hen", "Lib::Egg");
  EXPECT_FALSE(InitializerRegistry::InitializeAll(PropList()));
  EXPECT_TRUE(mLog.empty());
}

// An init function may load a library (registering newcomers, which run in
// the same pass) and may itself call InitializeAll. The nested call leaves an
// entry that depends on the init still running to the outer call; that is
// no failure.
TEST_F(InitializerRegistryTest, InitFunctionsMayRegisterAndInitializeMore) {
  bool nested = false;
  Register("Lib::Loader", nullptr, [&](const PropList& inProperties) {
    Register("Lib::Loaded");
    nested = InitializerRegistry::InitializeAll(inProperties);
    return true;
  });
  Register("Lib::User", "Lib::Loader");
  EXPECT_TRUE(InitializerRegistry::InitializeAll(PropList()));
  EXPECT_TRUE(nested);
  EXPECT_EQ((std::vector<std::string>{"init Lib::Loader", "init Lib::Loaded", "init Lib::User"}), mLog);
}

}  // namespace
