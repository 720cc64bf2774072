#include "TestSupport.h"

#include <kivcore/Debug.h>
#include <kivcore/Error.h>
#include <kivcore/Guid.h>

#include <atomic>
#include <memory>
#include <stdexcept>
#include <string>

using namespace kivcore;

namespace {

// What reporting inKey gives: the key and text of what the default handler
// throws, or "returned" when an installed handler returns.
std::string Report(const char* inKey) {
  try {
    config::ThrowError(3, inKey, 105, -2, true, {}, {}, {}, {});
  } catch (const config::Error& e) {
    return e.Report().key + " -> " + e.what();
  }
  return "returned";
}

// The display text follows the first '='. A failed contract check is named
// by the next error on its thread and never again, whether the default
// handler reports it or a host's handler takes it or throws; a check whose
// dialog throws is named by none. Each Set
// returns the previous handler; an empty one restores the default.
TEST(ErrorReporting, EachErrorReportsTheLastFailedCheckOnceWhateverItsHandlerDoes) {
  EXPECT_FALSE(kivcore::debug::IsDebuggerAttached()) << "the suite runs without a debugger";
  EXPECT_FALSE(debug::BreakAfterContractDialog("in != NULL", "Broadcaster.cpp", "Tarn::AddListener", 92));
  EXPECT_EQ("$$$/K=a=b -> a=b: in != NULL in Tarn::AddListener at Broadcaster.cpp:92", Report("$$$/K=a=b"));
  EXPECT_EQ("$$$/K=a=b -> a=b", Report("$$$/K=a=b"));
  std::string seen;
  EXPECT_FALSE(debug::SetContractDialogHandler(
      [&seen](const char* inCondition, const char*, const char*, int) { return !(seen = inCondition).empty(); }));
  EXPECT_FALSE(config::SetErrorHandler([&seen](const config::ErrorReport& inReport) {
    seen += "|" + inReport.key + "|" + debug::TakeLastContractViolation();
  }));
  EXPECT_TRUE(debug::BreakAfterContractDialog("p", "g.cpp", "G", 40));
  EXPECT_EQ("returned", Report(nullptr));
  EXPECT_EQ("p||p, G, g.cpp:40", seen);
  config::SetErrorHandler([](const config::ErrorReport&) { throw std::logic_error("host refuses"); });
  debug::BreakAfterContractDialog("q", "h.cpp", "H", 5);
  EXPECT_THROW(Report("$$$/K"), std::logic_error);
  debug::SetContractDialogHandler([](const char*, const char*, const char*, int) -> bool { throw 0; });
  EXPECT_THROW(debug::BreakAfterContractDialog("r", "i.cpp", "I", 6), int);
  EXPECT_TRUE(config::SetErrorHandler(nullptr) && debug::SetContractDialogHandler(nullptr));
  EXPECT_EQ("$$$/K -> $$$/K", Report("$$$/K"));
}

// Threads swap handlers while they report: every report and every contract
// dialog reaches exactly one handler (none falls through to the default,
// which would throw), no handler is destroyed while it runs, and no thread
// sees another's failed check.
TEST(ErrorReportingThreads, SwappedHandlersSeeEachReportOnceAndFailedChecksStayOnTheirThread) {
  constexpr int kRounds = 2000;
  std::atomic<int> handled{0}, dialogs{0};
  debug::BreakAfterContractDialog("main's", "t.cpp", "Main::Check", 3);
  platform_test::ThreadGroup threads;
  for (int t = 0; t < 4; ++t) {
    threads.Start([&handled, &dialogs] {
      for (int i = 0; i < kRounds; ++i) {
        auto calls = std::make_shared<std::atomic<int>>(0);  // freed with the handler
        config::SetErrorHandler([&handled, calls](const config::ErrorReport&) {
          handled.fetch_add(debug::TakeLastContractViolation().empty() ? 1 : 1000000);
          calls->fetch_add(1);
        });
        EXPECT_EQ("returned", Report("$$$/K"));
        debug::SetContractDialogHandler([&dialogs, calls](const char*, const char*, const char*, int) {
          calls->fetch_add(1);
          return dialogs.fetch_add(1) >= 0;
        });
        EXPECT_TRUE(debug::BreakAfterContractDialog("t", "t.cpp", "T", 1));
        debug::TakeLastContractViolation();
      }
    });
  }
  threads.JoinAll();
  config::SetErrorHandler(nullptr);
  debug::SetContractDialogHandler(nullptr);
  EXPECT_EQ(4 * kRounds, handled.load());
  EXPECT_EQ(4 * kRounds, dialogs.load());
  EXPECT_EQ("main's, Main::Check, t.cpp:3", debug::TakeLastContractViolation());
}

// A thread-exit destructor that runs after the thread made its first
// identifier still makes valid, distinct ones.
TEST(GuidThreads, ALateThreadExitDestructorMakesValidDistinctIdentifiers) {
  static std::string made[2];
  struct Late {
    ~Late() {
      for (std::string& text : made) text = utility::Guid::CreateUnique().AsUTF8String();
    }
  };
  std::thread([] {
    static thread_local Late late;  // constructed first, so destroyed after the generator
    utility::Guid::CreateUnique();
  }).join();
  EXPECT_NE(made[0], made[1]);
  EXPECT_EQ('4', made[0].at(15)) << made[0];  // version 4, random
}

}  // namespace
