#include <kivcore/Error.h>
#include <kivcore/InitializerRegistry.h>

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <future>
#include <memory>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

using namespace kivcore::config;
using kivcore::proplist::PropList;

namespace {

std::vector<std::string> sLog;  // what the entries below did, in order

// An entry, withdrawn when the registrar goes, that logs its init and its
// termination. Its init answers inInit(); a name starting with '!' has a
// terminator that throws.
std::unique_ptr<InitializerRegistrar> Entry(
    std::string inName, const char* inDependency = nullptr, std::function<bool()> inInit = [] { return true; }) {
  return std::make_unique<InitializerRegistrar>(
      inName.c_str(), EInitializerContextFlags(10),
      [inName, inInit](const PropList& inProperties) {
        sLog.push_back("init " + inName + inProperties.Get("mode"));
        return inInit();
      },
      [inName] {
        sLog.push_back("term " + inName);
        if (inName[0] == '!') throw std::runtime_error("teardown failed");
      },
      InitializerDependencies{inDependency});
}

// Entries run after what they depend on (a dependency not registered holds
// nothing back), once, and terminate in the reverse order of their inits'
// completion. An init function may load a library (registering newcomers,
// which run in the same pass) and call InitializeAll itself: the nested call
// leaves an entry that waits for the init still running to the outer call,
// and that is no failure.
TEST(InitializerRegistry, EntriesRunInDependencyOrderAndInitFunctionsMayInitializeMore) {
  sLog.clear();
  bool nested = false;
  std::unique_ptr<InitializerRegistrar> loaded;
  const auto user = Entry("User", "Loader");
  const auto other = Entry("Other", "NotRegistered");
  const auto loader = Entry("Loader", nullptr, [&] {
    loaded = Entry("Loaded", "Other");
    nested = InitializerRegistry::InitializeAll(PropList());
    return true;
  });
  PropList properties;
  properties.Set("mode", ":x");
  EXPECT_TRUE(InitializerRegistry::InitializeAll(properties));
  EXPECT_TRUE(nested);
  EXPECT_TRUE(InitializerRegistry::InitializeAll(properties)) << "initialized entries do not run again";
  EXPECT_TRUE(InitializerRegistry::IsRegistered("Loaded") && !InitializerRegistry::IsRegistered("NotRegistered"));
  InitializerRegistry::TerminateAll();
  InitializerRegistry::TerminateAll();
  EXPECT_EQ((std::vector<std::string>{"init Other:x", "init Loader:x", "init Loaded", "init User:x", "term User",
                                      "term Loader", "term Loaded", "term Other"}),
            sLog);
}

// A cycle fails; a failing or throwing init stops the run (one that withdrew
// its own entry while it ran included) and is tried again
// next time; a withdrawn entry is not terminated; a throwing terminator does
// not keep the others from running.
TEST(InitializerRegistry, FailuresStopTheRunAndOnlyWhatWasInitializedIsTerminated) {
  sLog.clear();
  {
    std::unique_ptr<InitializerRegistrar> quitter;
    quitter = Entry("Quitter", nullptr, [&quitter] {
      quitter.reset();
      return false;
    });
    EXPECT_FALSE(InitializerRegistry::InitializeAll(PropList())) << "an init that withdrew its entry and failed";
  }
  {
    const auto egg = Entry("Egg", "Hen");
    const auto hen = Entry("Hen", "Egg");
    EXPECT_FALSE(InitializerRegistry::InitializeAll(PropList()));
  }
  bool succeed = false;
  const auto a = Entry("!A");
  const auto b = Entry("B", nullptr, [&succeed] { return succeed; });
  auto c = Entry("C", nullptr, []() -> bool { throw std::runtime_error("no"); });
  auto d = Entry("D");
  EXPECT_FALSE(InitializerRegistry::InitializeAll(PropList()));
  succeed = true;
  EXPECT_FALSE(InitializerRegistry::InitializeAll(PropList()));
  c.reset();
  EXPECT_TRUE(InitializerRegistry::InitializeAll(PropList()));
  d.reset();
  EXPECT_THROW(InitializerRegistry::TerminateAll(), std::runtime_error);
  EXPECT_EQ((std::vector<std::string>{"init Quitter", "init !A", "init B", "init B", "init C", "init D", "term B", "term !A"}), sLog);
}

// A second InitializeAll made while another thread runs an init waits for it
// to finish, rather than answering before the library is up. But an init
// that hands work to a loader thread calling InitializeAll, and waits for it,
// gets an answer after the wait limit, with a report, not a deadlock.
TEST(InitializerRegistry, ACallerWaitsForTheInitRunningOnAnotherThreadUpToTheLimit) {
  sLog.clear();
  std::promise<void> entered, release;
  const std::shared_future<void> go = release.get_future().share();
  std::atomic<bool> finished{false};
  auto slow = Entry("Slow", nullptr, [&] {
    entered.set_value();
    go.wait();
    finished = true;
    return true;
  });
  std::thread first([] { EXPECT_TRUE(InitializerRegistry::InitializeAll(PropList())); });
  entered.get_future().wait();
  std::thread second([&] {
    EXPECT_TRUE(InitializerRegistry::InitializeAll(PropList()));
    EXPECT_TRUE(finished) << "answered while the init was still running";
  });
  std::this_thread::sleep_for(std::chrono::milliseconds(20));  // most likely, the second caller is in by now
  release.set_value();
  first.join();
  second.join();
  slow.reset();

  const auto previousLimit = InitializerRegistry::SetRunWaitLimit(std::chrono::milliseconds(20));
  int reports = 0;
  const auto previousHandler = ErrorManager::SetExceptionHandler([&reports](std::exception_ptr) { ++reports; });
  auto answer = std::make_shared<std::promise<bool>>();
  const auto waiter = Entry("Waiter", nullptr, [answer] {
    std::thread([answer] { answer->set_value(InitializerRegistry::InitializeAll(PropList())); }).detach();
    return answer->get_future().wait_for(std::chrono::seconds(20)) == std::future_status::ready;
  });
  EXPECT_TRUE(InitializerRegistry::InitializeAll(PropList())) << "deadlocked";
  ErrorManager::SetExceptionHandler(previousHandler);
  InitializerRegistry::SetRunWaitLimit(previousLimit);
  EXPECT_EQ(1, reports);
  InitializerRegistry::TerminateAll();
  EXPECT_EQ((std::vector<std::string>{"init Slow", "init Waiter", "term Waiter"}), sLog);
}

}  // namespace
