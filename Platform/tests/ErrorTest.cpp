#include <kivcore/Debug.h>
#include <kivcore/Error.h>

#include <gtest/gtest.h>

#include <sys/ptrace.h>
#include <sys/wait.h>
#include <unistd.h>

#include <stdexcept>
#include <string>
#include <vector>

using namespace kivcore;
using config::ErrorManager;
using config::ErrorReport;
using config::ReplacementValue;

namespace {

constexpr const char* kContractKey =
    "$$$/kivcore/utility/Error/Contract/InputContractViolation=An input contract violation has occurred!";

void Report(const char* inKey) {
  config::ThrowError(0, inKey, 105, 25, true, ReplacementValue(), ReplacementValue(), ReplacementValue(),
                     ReplacementValue());
}

// Gives every test the default handlers and no recorded violation, whatever
// the previous test left.
class ErrorReporting : public ::testing::Test {
protected:
  void SetUp() override { Restore(); }
  void TearDown() override { Restore(); }

private:
  static void Restore() {
    config::SetErrorHandler(nullptr);
    ErrorManager::SetExceptionHandler(nullptr);
    debug::SetContractDialogHandler(nullptr);
    (void)debug::TakeLastContractViolation();
  }
};

std::string WhatOfReport(const char* inKey) {
  try {
    Report(inKey);
  } catch (const config::Error& e) {
    return e.what();
  }
  ADD_FAILURE() << "ThrowError returned instead of throwing";
  return std::string();
}

TEST_F(ErrorReporting, DefaultThrowErrorThrowsErrorCarryingTheReport) {
  try {
    config::ThrowError(3, "$$$/Test/Key=Something broke", 7, -2, false, ReplacementValue(), ReplacementValue(),
                       ReplacementValue(), ReplacementValue());
    FAIL() << "ThrowError returned";
  } catch (const config::Error& e) {
    EXPECT_STREQ("Something broke", e.what());
    EXPECT_EQ(3, e.Report().level);
    EXPECT_EQ("$$$/Test/Key=Something broke", e.Report().key);
    EXPECT_EQ(7u, e.Report().number);
    EXPECT_EQ(-2, e.Report().code);
    EXPECT_FALSE(e.Report().flag);
  }
}

TEST_F(ErrorReporting, DisplayTextIsEverythingAfterTheFirstEqualsSign) {
  EXPECT_EQ("a=b", WhatOfReport("$$$/Test/Key=a=b"));
  EXPECT_EQ("", WhatOfReport("$$$/Test/Key="));
  EXPECT_EQ("$$$/Test/NoDisplayText", WhatOfReport("$$$/Test/NoDisplayText"));
}

TEST_F(ErrorReporting, ErrorAfterAFailedContractCheckNamesTheCheck) {
  EXPECT_FALSE(debug::BreakAfterContractDialog("inListener != NULL", "/src/Messaging/Src/Broadcaster.cpp",
                                               "Tarn::Broadcaster::AddListener", 92));
  EXPECT_EQ(
      "An input contract violation has occurred!: inListener != NULL in Tarn::Broadcaster::AddListener at "
      "/src/Messaging/Src/Broadcaster.cpp:92",
      WhatOfReport(kContractKey));
}

TEST_F(ErrorReporting, ContractViolationIsReportedOnlyByTheNextError) {
  debug::BreakAfterContractDialog("!inToStationID.empty()", "StationUtils.cpp", "Tarn::StationUtils::SwitchStation",
                                  316);
  EXPECT_NE(std::string::npos, WhatOfReport(kContractKey).find("SwitchStation"));
  EXPECT_EQ("An input contract violation has occurred!", WhatOfReport(kContractKey));
}

TEST_F(ErrorReporting, LaterContractFailureReplacesAnEarlierUnreportedOne) {
  debug::BreakAfterContractDialog("first", "a.cpp", "A", 1);
  debug::BreakAfterContractDialog("second", "b.cpp", "B", 2);
  EXPECT_EQ("second, B, b.cpp:2", debug::TakeLastContractViolation());
  EXPECT_EQ("", debug::TakeLastContractViolation());
}

TEST_F(ErrorReporting, ContractDialogHandlerGetsTheCheckAndItsAnswerIsReturned) {
  std::vector<std::string> seen;
  debug::SetContractDialogHandler([&](const char* inCondition, const char* inFile, const char* inFunction, int inLine) {
    seen = {inCondition, inFile, inFunction, std::to_string(inLine)};
    return true;
  });
  EXPECT_TRUE(debug::BreakAfterContractDialog("x > 0", "f.cpp", "Ns::F", 12));
  EXPECT_EQ((std::vector<std::string>{"x > 0", "f.cpp", "Ns::F", "12"}), seen);
  // The violation is recorded with a handler installed too.
  EXPECT_EQ("x > 0, Ns::F, f.cpp:12", debug::TakeLastContractViolation());
}

TEST_F(ErrorReporting, SettingAHandlerReturnsThePreviousOneAndEmptyRestoresTheDefault) {
  int firstCalls = 0;
  debug::SetContractDialogHandler([&](const char*, const char*, const char*, int) {
    ++firstCalls;
    return true;
  });
  debug::ContractDialogHandler previous =
      debug::SetContractDialogHandler([](const char*, const char*, const char*, int) { return false; });
  ASSERT_TRUE(previous);
  EXPECT_TRUE(previous("c", "f", "g", 1));
  EXPECT_EQ(1, firstCalls);
  EXPECT_TRUE(debug::SetContractDialogHandler(nullptr));
  EXPECT_FALSE(debug::SetContractDialogHandler(nullptr)) << "no handler was installed";
  EXPECT_FALSE(debug::BreakAfterContractDialog("c", "f", "g", 1));
}

TEST_F(ErrorReporting, CustomErrorHandlerReceivesTheReportAndThrowErrorReturns) {
  std::vector<ErrorReport> reports;
  EXPECT_FALSE(config::SetErrorHandler([&](const ErrorReport& inReport) { reports.push_back(inReport); }));
  EXPECT_NO_THROW(Report(kContractKey));
  ASSERT_EQ(1u, reports.size());
  EXPECT_EQ(kContractKey, reports[0].key);
  EXPECT_EQ(0, reports[0].level);
  EXPECT_EQ(105u, reports[0].number);
  EXPECT_EQ(25, reports[0].code);
  EXPECT_TRUE(reports[0].flag);

  config::ErrorHandler previous = config::SetErrorHandler(nullptr);
  EXPECT_TRUE(previous);
  EXPECT_THROW(Report(kContractKey), config::Error);
  EXPECT_EQ(1u, reports.size());
}

TEST_F(ErrorReporting, CustomErrorHandlerMayTakeTheViolationAndItIsForgottenAfterwards) {
  std::string taken;
  config::SetErrorHandler([&](const ErrorReport&) { taken = debug::TakeLastContractViolation(); });
  debug::BreakAfterContractDialog("p != nullptr", "g.cpp", "Ns::G", 40);
  Report(kContractKey);
  EXPECT_EQ("p != nullptr, Ns::G, g.cpp:40", taken);

  // A handler that ignores the violation does not leave it for a later error.
  config::SetErrorHandler([](const ErrorReport&) {});
  debug::BreakAfterContractDialog("q != nullptr", "g.cpp", "Ns::G", 41);
  Report(kContractKey);
  config::SetErrorHandler(nullptr);
  EXPECT_EQ("An input contract violation has occurred!", WhatOfReport(kContractKey));
}

TEST_F(ErrorReporting, ThrowingCustomHandlerPropagatesAndStillForgetsTheViolation) {
  config::SetErrorHandler([](const ErrorReport&) { throw std::logic_error("host refuses"); });
  debug::BreakAfterContractDialog("r", "h.cpp", "Ns::H", 5);
  EXPECT_THROW(Report(kContractKey), std::logic_error);
  EXPECT_EQ("", debug::TakeLastContractViolation());
}

TEST_F(ErrorReporting, NullKeyIsReportedAsEmpty) {
  std::string key = "unset";
  config::SetErrorHandler([&](const ErrorReport& inReport) { key = inReport.key; });
  Report(nullptr);
  EXPECT_EQ("", key);
}

TEST_F(ErrorReporting, GuardedCallReturnsTheResultOfACallThatDoesNotThrow) {
  int calls = 0;
  EXPECT_EQ(42, ErrorManager::Get(false)->GuardedCall([&] {
    ++calls;
    return 42;
  }));
  EXPECT_EQ(1, calls);
}

TEST_F(ErrorReporting, GuardedCallHandsTheExceptionToTheHandlerAndReturnsNormally) {
  std::vector<std::string> handled;
  ErrorManager::SetExceptionHandler([&](std::exception_ptr inException) {
    try {
      std::rethrow_exception(inException);
    } catch (const std::runtime_error& e) {
      handled.push_back(e.what());
    } catch (...) {
      handled.push_back("?");
    }
  });
  int calls = 0;
  const int result = ErrorManager::Get(false)->GuardedCall([&]() -> int {
    ++calls;
    throw std::runtime_error("listener failed");
  });
  EXPECT_EQ(0, result);
  EXPECT_EQ(1, calls);
  EXPECT_EQ((std::vector<std::string>{"listener failed"}), handled);
}

TEST_F(ErrorReporting, DefaultGuardedCallWritesOneLineNamingTheException) {
  testing::internal::CaptureStderr();
  ErrorManager::Get(false)->GuardedCall([]() -> int { throw std::runtime_error("delivery failed"); });
  EXPECT_EQ("kivcore: exception in guarded call: delivery failed\n", testing::internal::GetCapturedStderr());

  testing::internal::CaptureStderr();
  ErrorManager::Get(false)->GuardedCall([]() -> int { throw 17; });
  EXPECT_EQ("kivcore: exception in guarded call: unknown exception\n", testing::internal::GetCapturedStderr());
}

TEST_F(ErrorReporting, ExceptionHandlerThatThrowsDoesNotEscapeGuardedCall) {
  ErrorManager::SetExceptionHandler([](std::exception_ptr) { throw std::logic_error("handler failed"); });
  testing::internal::CaptureStderr();
  int result = -1;
  EXPECT_NO_THROW(result = ErrorManager::Get(false)->GuardedCall([]() -> int { throw std::runtime_error("first"); }));
  const std::string output = testing::internal::GetCapturedStderr();
  EXPECT_EQ(0, result);
  EXPECT_EQ("kivcore: exception in guarded call: first\n", output);
}

// Runs inChild in a forked process and returns its wait status.
template <class Body>
int StatusOfChild(Body inChild) {
  const pid_t child = fork();
  if (child == 0) {
    inChild();
    _exit(0);
  }
  int status = -1;
  if (child < 0 || waitpid(child, &status, 0) != child) ADD_FAILURE() << "could not run the child process";
  return status;
}

TEST(Debugger, BreakingWithoutADebuggerLetsTheProcessGoOn) {
  if (debug::IsDebuggerAttached()) GTEST_SKIP() << "running under a debugger";
  const int status = StatusOfChild([] {
    debug::BreakIntoDebugger();
    _exit(debug::IsDebuggerAttached() ? 1 : 0);
  });
  ASSERT_TRUE(WIFEXITED(status)) << "ended by signal " << (WIFSIGNALED(status) ? WTERMSIG(status) : 0);
  EXPECT_EQ(0, WEXITSTATUS(status));
}

TEST(Debugger, ATracedProcessSeesItsDebugger) {
  if (debug::IsDebuggerAttached()) GTEST_SKIP() << "running under a debugger";
  constexpr int kNotTraceable = 3;
  const int status = StatusOfChild([] {
    // The parent becomes the tracer; it never resumes a stop, so the child
    // only checks and exits.
    if (ptrace(PTRACE_TRACEME, 0, nullptr, nullptr) != 0) _exit(kNotTraceable);
    _exit(debug::IsDebuggerAttached() ? 0 : 1);
  });
  ASSERT_TRUE(WIFEXITED(status));
  if (WEXITSTATUS(status) == kNotTraceable) GTEST_SKIP() << "tracing is not permitted here";
  EXPECT_EQ(0, WEXITSTATUS(status));
}

}  // namespace
