// The contract-check procedure as the broadcaster's checks run it (dialog,
// optional debugger break, ThrowError), what each check site reports, how
// operations go on when the report returns, and NullInterfaceException.
//
// This executable interposes two kivcore functions, ThrowError and
// IsDebuggerAttached: the definitions below are exported from the
// executable, so the messaging library's calls reach them first. Each records
// what the library passed and forwards to kivcore's own definition (found
// with dlsym(RTLD_NEXT)), so kivcore's handlers still run. That is the only
// way to see the replacement values the library passes (the error handler
// does not receive them) and whether it asked for a debugger at all; it also
// lets a test pretend a debugger is attached, with a SIGTRAP handler standing
// in for the debugger.
#include "TestSupport.h"

#include <TarnMessaging/Broadcaster.h>
#include <TarnMessaging/NullInterfaceException.h>
#include <TarnMessaging/SafeListener.h>

#include <kivcore/Debug.h>
#include <kivcore/Error.h>
#include <kivcore/SmallBlockAllocator.h>

#include <gtest/gtest.h>

#include <dlfcn.h>

#include <atomic>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <utility>
#include <vector>

using messaging_test::CallLog;
using messaging_test::ContractDialogRecorder;
using messaging_test::ContractViolation;
using messaging_test::CountedSafeListener;
using messaging_test::DefaultErrorHandlerGuard;
using messaging_test::ErrorRecorder;
using messaging_test::MainThreadGuard;
using messaging_test::PingMessage;
using messaging_test::RecordingListener;

namespace {

constexpr char kContractKey[] =
    "$$$/kivcore/utility/Error/Contract/InputContractViolation=An input contract violation has occurred!";
constexpr char kBroadcasterSource[] = "Messaging/Src/Broadcaster.cpp";

// What the interposed ThrowError was given.
struct ThrowErrorCall {
  int level;
  std::string key;
  unsigned int number;
  int code;
  bool flag;
  bool valuesEmpty[4];
  int trapsBefore;  // debugger breaks taken before this call
};

// Breaks taken, counted by the SIGTRAP handler of TrapCatcher (a lock-free
// atomic, so the handler may touch it).
std::atomic<int> gTraps{0};

// State of the interposers; reset by the fixture.
struct Interposed {
  std::mutex mMutex;
  std::vector<ThrowErrorCall> mThrowErrorCalls;  // guarded by mMutex
  std::atomic<int> mDebuggerQueries{0};
  std::atomic<bool> mPretendDebugger{false};
};
Interposed& State() {
  static Interposed* state = new Interposed;  // never destroyed: checks may run at exit
  return *state;
}

template <class Function>
Function NextDefinition(const char* inMangledName) {
  void* symbol = ::dlsym(RTLD_NEXT, inMangledName);
  if (symbol == nullptr) {
    std::fprintf(stderr, "interposer: %s not found after the executable\n", inMangledName);
    std::abort();
  }
  return reinterpret_cast<Function>(symbol);
}

}  // namespace

namespace kivcore::config {
void ThrowError(ErrorLevel inLevel, const char* inKey, unsigned int inNumber, int inCode, bool inFlag,
                const ReplacementValue& inValue1, const ReplacementValue& inValue2, const ReplacementValue& inValue3,
                const ReplacementValue& inValue4) {
  {
    std::lock_guard<std::mutex> lock(State().mMutex);
    State().mThrowErrorCalls.push_back(ThrowErrorCall{inLevel,
                                                      inKey != nullptr ? inKey : "",
                                                      inNumber,
                                                      inCode,
                                                      inFlag,
                                                      {inValue1.empty(), inValue2.empty(), inValue3.empty(),
                                                       inValue4.empty()},
                                                      gTraps.load()});
  }
  using Real = void (*)(ErrorLevel, const char*, unsigned int, int, bool, const ReplacementValue&,
                        const ReplacementValue&, const ReplacementValue&, const ReplacementValue&);
  static const Real real =
      NextDefinition<Real>("_ZN7kivcore6config10ThrowErrorEiPKcjibRKNS0_16ReplacementValueES5_S5_S5_");
  real(inLevel, inKey, inNumber, inCode, inFlag, inValue1, inValue2, inValue3, inValue4);
}
}  // namespace kivcore::config

namespace kivcore::debug {
bool IsDebuggerAttached() {
  State().mDebuggerQueries.fetch_add(1);
  if (State().mPretendDebugger.load()) return true;
  static const auto real = NextDefinition<bool (*)()>("_ZN7kivcore5debug18IsDebuggerAttachedEv");
  return real();
}
}  // namespace kivcore::debug

namespace {

std::vector<ThrowErrorCall> ThrowErrorCalls() {
  std::lock_guard<std::mutex> lock(State().mMutex);
  return State().mThrowErrorCalls;
}

bool EndsWith(const std::string& inText, const std::string& inEnd) {
  return inText.size() >= inEnd.size() && inText.compare(inText.size() - inEnd.size(), inEnd.size(), inEnd) == 0;
}

// Catches SIGTRAP for its lifetime, standing in for a debugger: the library
// raises it at a check site when the dialog asks to break and a debugger is
// attached.
class TrapCatcher {
public:
  TrapCatcher() {
    gTraps.store(0);
    struct sigaction action {};
    action.sa_handler = [](int) { gTraps.fetch_add(1); };
    sigemptyset(&action.sa_mask);
    ::sigaction(SIGTRAP, &action, &mPrevious);
  }
  TrapCatcher(const TrapCatcher&) = delete;
  TrapCatcher& operator=(const TrapCatcher&) = delete;
  ~TrapCatcher() { ::sigaction(SIGTRAP, &mPrevious, nullptr); }
  static int Traps() { return gTraps.load(); }

private:
  struct sigaction mPrevious {};
};

// An object that offers ISafeListener only: no weak reference, so a
// broadcaster cannot hold it. Its count is observable; it is never deleted
// through Release (it lives on the test's stack).
class UnweakableListener : public Tarn::ISafeListener {
public:
  std::int32_t AddRef() override { return ++mCount; }
  std::int32_t Release() override { return --mCount; }
  std::int32_t QueryInterface(const Tarn::IID& inIID, void** outInterface) override {
    if (inIID == Tarn::IID_ISafeListener) {
      *outInterface = static_cast<Tarn::ISafeListener*>(this);
      return Tarn::kInterfaceOK;
    }
    *outInterface = nullptr;
    return Tarn::kNoInterface;
  }
  void ListenToMessage(const Tarn::Message&) override { ++mCalls; }

  std::atomic<std::int32_t> mCount{0};
  int mCalls = 0;
};

class ContractCheck : public ::testing::Test {
protected:
  ContractCheck() {
    std::lock_guard<std::mutex> lock(State().mMutex);
    State().mThrowErrorCalls.clear();
    State().mDebuggerQueries.store(0);
    State().mPretendDebugger.store(false);
  }
  ~ContractCheck() override { State().mPretendDebugger.store(false); }

  // One violation recorded by the dialog; fails the test otherwise.
  ContractViolation OnlyViolation() const {
    const std::vector<ContractViolation> violations = mDialog.Violations();
    EXPECT_EQ(1u, violations.size());
    return violations.empty() ? ContractViolation{} : violations.front();
  }

  MainThreadGuard mMainThread;
  ErrorRecorder mErrors;  // ThrowError returns, so operations go on
  ContractDialogRecorder mDialog{false};
  Tarn::Broadcaster mBroadcaster;
};

// ---------------------------------------------------------------------------
// The procedure

TEST_F(ContractCheck, PassingChecksCallNoneOfTheReportingFunctions) {
  RecordingListener plain("plain");
  auto boostListener = boost::make_shared<RecordingListener>("boost");
  auto stdListener = std::make_shared<RecordingListener>("std");
  Tarn::ISafeListenerRef safe(new CountedSafeListener("safe"));

  mBroadcaster.AddListener(&plain);
  mBroadcaster.AddListener(boost::weak_ptr<Tarn::Listener>(boostListener));
  mBroadcaster.AddListener(std::weak_ptr<Tarn::Listener>(stdListener));
  mBroadcaster.AddListener(safe);
  EXPECT_TRUE(mBroadcaster.HasListener(&plain));
  mBroadcaster.RemoveListener(&plain, true);
  mBroadcaster.RemoveListener(boost::weak_ptr<Tarn::Listener>(boostListener));
  mBroadcaster.RemoveListener(std::weak_ptr<Tarn::Listener>(stdListener));
  mBroadcaster.RemoveListener(safe);

  EXPECT_EQ(0u, mDialog.Count());
  EXPECT_TRUE(ThrowErrorCalls().empty());
  EXPECT_EQ(0, State().mDebuggerQueries.load());
  EXPECT_FALSE(mBroadcaster.HasListeners());
}

TEST_F(ContractCheck, FailedCheckShowsTheDialogWithConditionSourceFunctionAndLine) {
  mBroadcaster.AddListener(static_cast<Tarn::Listener*>(nullptr));
  const ContractViolation violation = OnlyViolation();
  EXPECT_EQ("inListener != NULL", violation.condition);
  EXPECT_PRED2(EndsWith, violation.file, kBroadcasterSource);
  EXPECT_EQ("Tarn::Broadcaster::AddListener", violation.function);
  EXPECT_GT(violation.line, 0);
}

TEST_F(ContractCheck, FailedCheckCallsThrowErrorOnceWithTheContractViolationReport) {
  mBroadcaster.AddListener(static_cast<Tarn::Listener*>(nullptr));
  const std::vector<ThrowErrorCall> calls = ThrowErrorCalls();
  ASSERT_EQ(1u, calls.size());
  EXPECT_EQ(0, calls[0].level);
  EXPECT_EQ(kContractKey, calls[0].key);
  EXPECT_EQ(99u, calls[0].key.size());
  EXPECT_EQ(105u, calls[0].number);
  EXPECT_EQ(25, calls[0].code);
  EXPECT_TRUE(calls[0].flag);
  for (bool empty : calls[0].valuesEmpty) EXPECT_TRUE(empty);
  // The installed error handler got the same report.
  ASSERT_EQ(1u, mErrors.Count());
  EXPECT_EQ(kContractKey, mErrors.Reports()[0].key);
}

TEST_F(ContractCheck, DialogAnsweringContinueAsksForNoDebugger) {
  mBroadcaster.RemoveListener(static_cast<Tarn::Listener*>(nullptr), true);
  EXPECT_EQ(1u, mDialog.Count());
  EXPECT_EQ(0, State().mDebuggerQueries.load());
  EXPECT_EQ(1u, ThrowErrorCalls().size());
}

TEST_F(ContractCheck, DialogAnsweringBreakWithoutADebuggerDoesNotBreakAndStillReports) {
  ContractDialogRecorder breakingDialog(true);
  TrapCatcher traps;
  mBroadcaster.AddListener(static_cast<Tarn::Listener*>(nullptr));
  EXPECT_EQ(1u, breakingDialog.Count());
  EXPECT_EQ(1, State().mDebuggerQueries.load());
  EXPECT_EQ(0, TrapCatcher::Traps());
  EXPECT_EQ(1u, ThrowErrorCalls().size());
}

TEST_F(ContractCheck, DialogAnsweringBreakUnderADebuggerBreaksThenReports) {
  ContractDialogRecorder breakingDialog(true);
  TrapCatcher traps;
  State().mPretendDebugger.store(true);
  mBroadcaster.AddListener(static_cast<Tarn::Listener*>(nullptr));
  EXPECT_EQ(1, TrapCatcher::Traps());
  EXPECT_EQ(1, State().mDebuggerQueries.load());
  const std::vector<ThrowErrorCall> calls = ThrowErrorCalls();
  ASSERT_EQ(1u, calls.size());
  EXPECT_EQ(1, calls[0].trapsBefore);  // the report follows the break
}

TEST_F(ContractCheck, DialogAnsweringContinueNeverBreaksEvenUnderADebugger) {
  TrapCatcher traps;
  State().mPretendDebugger.store(true);
  mBroadcaster.AddListener(static_cast<Tarn::Listener*>(nullptr));
  EXPECT_EQ(0, TrapCatcher::Traps());
  EXPECT_EQ(0, State().mDebuggerQueries.load());
  EXPECT_EQ(1u, ThrowErrorCalls().size());
}

// ---------------------------------------------------------------------------
// The check sites

struct CheckSite {
  const char* mOperation;
  std::function<void(Tarn::Broadcaster&)> mCall;
  const char* mCondition;
  const char* mFunction;
};

TEST_F(ContractCheck, EveryCheckSiteReportsItsConditionAndFunctionOnItsOwnLine) {
  UnweakableListener unweakable;
  const Tarn::ISafeListenerRef unweakableRef(&unweakable);
  std::weak_ptr<Tarn::Listener> expiredStd = std::make_shared<RecordingListener>("gone");
  boost::weak_ptr<Tarn::Listener> expiredBoost = boost::make_shared<RecordingListener>("gone");

  const std::vector<CheckSite> sites = {
      {"AddListener(Listener*)", [](Tarn::Broadcaster& b) { b.AddListener(static_cast<Tarn::Listener*>(nullptr)); },
       "inListener != NULL", "Tarn::Broadcaster::AddListener"},
      {"AddListener(null safe)", [](Tarn::Broadcaster& b) { b.AddListener(Tarn::ISafeListenerRef()); },
       "inListener != NULL", "Tarn::Broadcaster::AddListener"},
      {"AddListener(unweakable safe)", [&](Tarn::Broadcaster& b) { b.AddListener(unweakableRef); },
       "IWeakReferenceCapableRef(inListener) != NULL", "Tarn::Broadcaster::AddListener"},
      {"AddListener(boost expired)", [&](Tarn::Broadcaster& b) { b.AddListener(expiredBoost); },
       "inListener.lock() != NULL", "Tarn::Broadcaster::AddListener"},
      {"AddListener(std expired)", [&](Tarn::Broadcaster& b) { b.AddListener(expiredStd); },
       "inListener.lock() != NULL", "Tarn::Broadcaster::AddListener"},
      {"RemoveListener(Listener*)",
       [](Tarn::Broadcaster& b) { b.RemoveListener(static_cast<Tarn::Listener*>(nullptr), true); },
       "inListener != NULL", "Tarn::Broadcaster::RemoveListener"},
      {"RemoveListener(null safe)", [](Tarn::Broadcaster& b) { b.RemoveListener(Tarn::ISafeListenerRef()); },
       "inListener != NULL", "Tarn::Broadcaster::RemoveListener"},
      {"RemoveListener(boost expired)", [&](Tarn::Broadcaster& b) { b.RemoveListener(expiredBoost); },
       "inListener.lock() != NULL", "Tarn::Broadcaster::RemoveListener"},
      {"RemoveListener(std expired)", [&](Tarn::Broadcaster& b) { b.RemoveListener(expiredStd); },
       "inListener.lock() != NULL", "Tarn::Broadcaster::RemoveListener"},
      {"HasListener(nullptr)", [](Tarn::Broadcaster& b) { b.HasListener(nullptr); }, "inListener",
       "Tarn::Broadcaster::HasListener"},
  };

  std::set<int> lines;
  for (const CheckSite& site : sites) {
    SCOPED_TRACE(site.mOperation);
    Tarn::Broadcaster broadcaster;
    mDialog.Clear();
    const std::size_t reportsBefore = ThrowErrorCalls().size();
    site.mCall(broadcaster);
    const std::vector<ContractViolation> violations = mDialog.Violations();
    // A null safe listener also fails the weak-reference check after its own.
    ASSERT_EQ(site.mOperation == std::string("AddListener(null safe)") ? 2u : 1u, violations.size());
    EXPECT_EQ(site.mCondition, violations[0].condition);
    EXPECT_EQ(site.mFunction, violations[0].function);
    EXPECT_PRED2(EndsWith, violations[0].file, kBroadcasterSource);
    EXPECT_EQ(reportsBefore + violations.size(), ThrowErrorCalls().size());
    lines.insert(violations[0].line);
  }
  // The check expands where it stands: ten sites, ten lines.
  EXPECT_EQ(sites.size(), lines.size());
  for (const ThrowErrorCall& call : ThrowErrorCalls()) {
    EXPECT_EQ(kContractKey, call.key);
    EXPECT_EQ(105u, call.number);
    EXPECT_EQ(25, call.code);
  }
}

// ---------------------------------------------------------------------------
// Operations go on when the report returns

TEST_F(ContractCheck, NullPlainListenerIsNeitherRegisteredNorFollowed) {
  mBroadcaster.AddListener(static_cast<Tarn::Listener*>(nullptr));
  mBroadcaster.RemoveListener(static_cast<Tarn::Listener*>(nullptr), true);
  mBroadcaster.RemoveListener(static_cast<Tarn::Listener*>(nullptr), false);
  EXPECT_FALSE(mBroadcaster.HasListeners());
  EXPECT_EQ(3u, mDialog.Count());
}

TEST_F(ContractCheck, ExpiredWeakListenersAreRegisteredAndPrunedByTheNextBroadcast) {
  boost::weak_ptr<Tarn::Listener> expiredBoost = boost::make_shared<RecordingListener>("gone");
  std::weak_ptr<Tarn::Listener> expiredStd = std::make_shared<RecordingListener>("gone");
  mBroadcaster.AddListener(expiredBoost);
  mBroadcaster.AddListener(expiredStd);
  EXPECT_EQ(2u, mDialog.Count());
  EXPECT_TRUE(mBroadcaster.HasListeners());
  mBroadcaster.BroadcastMessage(PingMessage());
  EXPECT_FALSE(mBroadcaster.HasListeners());
}

TEST_F(ContractCheck, RemovingThroughAnExpiredWeakPointerStillRemovesItsRegistration) {
  auto boostListener = boost::make_shared<RecordingListener>("boost");
  auto stdListener = std::make_shared<RecordingListener>("std");
  const boost::weak_ptr<Tarn::Listener> boostWeak(boostListener);
  const std::weak_ptr<Tarn::Listener> stdWeak(stdListener);
  mBroadcaster.AddListener(boostWeak);
  mBroadcaster.AddListener(stdWeak);
  boostListener.reset();
  stdListener.reset();

  mBroadcaster.RemoveListener(boostWeak);
  mBroadcaster.RemoveListener(stdWeak);
  EXPECT_EQ(2u, mDialog.Count());
  EXPECT_FALSE(mBroadcaster.HasListeners());
}

TEST_F(ContractCheck, NullSafeListenerLeavesAnEmptyRegistrationThatTheNextBroadcastPrunes) {
  mBroadcaster.AddListener(Tarn::ISafeListenerRef());
  ASSERT_EQ(2u, mDialog.Count());  // a null reference fails both checks
  EXPECT_EQ("IWeakReferenceCapableRef(inListener) != NULL", mDialog.Violations()[1].condition);
  EXPECT_TRUE(mBroadcaster.HasListeners());
  mBroadcaster.BroadcastMessage(PingMessage());
  EXPECT_FALSE(mBroadcaster.HasListeners());
}

TEST_F(ContractCheck, SafeListenerWithoutWeakReferenceIsReportedNeverCalledAndKeepsItsCount) {
  UnweakableListener unweakable;
  {
    const Tarn::ISafeListenerRef ref(&unweakable);
    mBroadcaster.AddListener(ref);
    EXPECT_EQ(1, unweakable.mCount.load());  // the conversion's reference was released again
    mBroadcaster.BroadcastMessage(PingMessage());
  }
  EXPECT_EQ(0, unweakable.mCalls);
  EXPECT_EQ(0, unweakable.mCount.load());
  EXPECT_FALSE(mBroadcaster.HasListeners());
  const ContractViolation violation = OnlyViolation();
  EXPECT_EQ("IWeakReferenceCapableRef(inListener) != NULL", violation.condition);
}

TEST_F(ContractCheck, HasListenerOfNullIsReportedAndFindsNoListener) {
  RecordingListener plain("plain");
  mBroadcaster.AddListener(&plain);
  EXPECT_FALSE(mBroadcaster.HasListener(nullptr));
  EXPECT_EQ("inListener", OnlyViolation().condition);
}

// ---------------------------------------------------------------------------
// The default error handler

TEST_F(ContractCheck, DefaultHandlerThrowsAnErrorNamingTheFailedCheck) {
  DefaultErrorHandlerGuard defaultHandler;
  try {
    mBroadcaster.AddListener(static_cast<Tarn::Listener*>(nullptr));
    FAIL() << "the default error handler returned";
  } catch (const kivcore::config::Error& error) {
    const ContractViolation violation = OnlyViolation();
    const std::string what = error.what();
    EXPECT_NE(std::string::npos, what.find("An input contract violation has occurred!")) << what;
    EXPECT_NE(std::string::npos, what.find("inListener != NULL")) << what;
    EXPECT_NE(std::string::npos, what.find("Tarn::Broadcaster::AddListener")) << what;
    EXPECT_NE(std::string::npos, what.find(std::string(kBroadcasterSource) + ":" + std::to_string(violation.line)))
        << what;
    EXPECT_EQ(0, error.Report().level);
    EXPECT_EQ(kContractKey, error.Report().key);
    EXPECT_EQ(105u, error.Report().number);
    EXPECT_EQ(25, error.Report().code);
    EXPECT_TRUE(error.Report().flag);
  }
  EXPECT_FALSE(mBroadcaster.HasListeners());
}

TEST_F(ContractCheck, DefaultHandlerAndDefaultDialogStillNameTheCheck) {
  DefaultErrorHandlerGuard defaultHandler;
  const kivcore::debug::ContractDialogHandler previousDialog = kivcore::debug::SetContractDialogHandler(nullptr);
  std::string what;
  try {
    mBroadcaster.RemoveListener(std::weak_ptr<Tarn::Listener>());
  } catch (const kivcore::config::Error& error) {
    what = error.what();
  }
  kivcore::debug::SetContractDialogHandler(previousDialog);
  EXPECT_NE(std::string::npos, what.find("inListener.lock() != NULL")) << what;
  EXPECT_NE(std::string::npos, what.find("Tarn::Broadcaster::RemoveListener")) << what;
  EXPECT_NE(std::string::npos, what.find(kBroadcasterSource)) << what;
}

TEST_F(ContractCheck, AThrowingReportLeavesTheOperationAtTheCheck) {
  DefaultErrorHandlerGuard defaultHandler;
  std::weak_ptr<Tarn::Listener> expired = std::make_shared<RecordingListener>("gone");
  EXPECT_THROW(mBroadcaster.AddListener(expired), kivcore::config::Error);
  EXPECT_FALSE(mBroadcaster.HasListeners());
}

TEST_F(ContractCheck, AThrowingReportReleasesTheReferencesTheOperationHeld) {
  DefaultErrorHandlerGuard defaultHandler;
  UnweakableListener unweakable;
  {
    const Tarn::ISafeListenerRef ref(&unweakable);
    EXPECT_THROW(mBroadcaster.AddListener(ref), kivcore::config::Error);
    EXPECT_EQ(1, unweakable.mCount.load());
  }
  EXPECT_EQ(0, unweakable.mCount.load());
  EXPECT_FALSE(mBroadcaster.HasListeners());
}

// ---------------------------------------------------------------------------
// NullInterfaceException

TEST(NullInterfaceException, TextOpensWithTheFixedPrefixAndCarriesTheDetail) {
  const Tarn::NullInterfaceException error("ISafeListener");
  EXPECT_STREQ("A NULL interface pointer has been dereferenced: ISafeListener", error.what());
}

TEST(NullInterfaceException, IsATarnException) {
  try {
    throw Tarn::NullInterfaceException("detail");
  } catch (const Tarn::Exception& error) {
    EXPECT_STREQ("A NULL interface pointer has been dereferenced: detail", error.what());
  }
}

TEST(NullInterfaceException, CopyHasTheSameTextInItsOwnStorage) {
  const Tarn::NullInterfaceException original("IWeakReferenceCapable");
  const Tarn::NullInterfaceException copy(original);
  EXPECT_STREQ(original.what(), copy.what());
  EXPECT_NE(static_cast<const void*>(original.what()), static_cast<const void*>(copy.what()));
}

TEST(NullInterfaceException, DestroyingOriginalAndCopyReturnsBothTextsToTheSmallBlockAllocator) {
  using kivcore::utility::SmallBlockAllocator;
  const SmallBlockAllocator::Statistics before = SmallBlockAllocator::GetStatistics();
  {
    const Tarn::NullInterfaceException original("ISafeListener");
    const SmallBlockAllocator::Statistics one = SmallBlockAllocator::GetStatistics();
    EXPECT_EQ(before.blocksInUse + 1, one.blocksInUse);  // the text is longer than any in-place buffer
    const Tarn::NullInterfaceException copy(original);
    EXPECT_EQ(before.blocksInUse + 2, SmallBlockAllocator::GetStatistics().blocksInUse);
  }
  const SmallBlockAllocator::Statistics after = SmallBlockAllocator::GetStatistics();
  EXPECT_EQ(before.blocksInUse, after.blocksInUse);
  EXPECT_EQ(before.bytesInUse, after.bytesInUse);
}

}  // namespace
