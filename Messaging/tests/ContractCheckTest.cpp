// Misuse reported through the contract check: the reporting procedure once,
// then every check site of the library, with the report returning (the
// operation goes on safely) and with the report throwing (the operation
// stops at the check, changes nothing and leaks nothing).
//
// The executable interposes kivcore's ThrowError and IsDebuggerAttached: its
// definitions are found before the library's, record what they were given
// and forward to kivcore's own (dlsym(RTLD_NEXT)). Only so can a test see the
// replacement values and whether a debugger was asked for.
#include "TestSupport.h"

#include <TarnMessaging.h>

#include <boost/make_shared.hpp>

#include <gtest/gtest.h>

#include <dlfcn.h>

#include <algorithm>
#include <csignal>
#include <cstdlib>
#include <fstream>
#include <functional>
#include <optional>
#include <set>
#include <string>
#include <utility>
#include <vector>

using kivcore::utility::ImmutableString;
using kivcore::utility::SmallBlockAllocator;
using messaging_test::ContractDialogRecorder;
using messaging_test::ContractViolation;
using messaging_test::RecordingListener;

namespace {

struct ThrowErrorCall {
  int level;
  std::string key;
  unsigned int number;
  int code;
  bool flag;
  bool allValuesEmpty;
  int trapsBefore;
};
std::vector<ThrowErrorCall> sThrowErrorCalls;  // the tests report on one thread only
int sDebuggerQueries = 0;
bool sPretendDebugger = false;
volatile std::sig_atomic_t sTraps = 0;

template <class Function>
Function NextDefinition(const char* inMangledName) {
  void* symbol = ::dlsym(RTLD_NEXT, inMangledName);
  if (symbol == nullptr) std::abort();
  return reinterpret_cast<Function>(symbol);
}

}  // namespace

namespace kivcore::config {
void ThrowError(ErrorLevel inLevel, const char* inKey, unsigned int inNumber, int inCode, bool inFlag,
                const ReplacementValue& inValue1, const ReplacementValue& inValue2, const ReplacementValue& inValue3,
                const ReplacementValue& inValue4) {
  sThrowErrorCalls.push_back({inLevel, inKey, inNumber, inCode, inFlag,
                              inValue1.empty() && inValue2.empty() && inValue3.empty() && inValue4.empty(),
                              static_cast<int>(sTraps)});
  using Real = void (*)(ErrorLevel, const char*, unsigned int, int, bool, const ReplacementValue&,
                        const ReplacementValue&, const ReplacementValue&, const ReplacementValue&);
  static const Real real =
      NextDefinition<Real>("_ZN7kivcore6config10ThrowErrorEiPKcjibRKNS0_16ReplacementValueES5_S5_S5_");
  real(inLevel, inKey, inNumber, inCode, inFlag, inValue1, inValue2, inValue3, inValue4);
}
}  // namespace kivcore::config

namespace kivcore::debug {
bool IsDebuggerAttached() {
  ++sDebuggerQueries;
  return sPretendDebugger;
}
}  // namespace kivcore::debug

namespace {

constexpr char kKey[] =
    "$$$/kivcore/utility/Error/Contract/InputContractViolation=An input contract violation has occurred!";

TEST(ContractCheck, AFailedCheckShowsTheDialogBreaksOnlyWhenAskedUnderADebuggerAndReportsOnce) {
  messaging_test::ErrorRecorder errors;
  struct sigaction previous {};
  struct sigaction onTrap {};
  onTrap.sa_handler = [](int) { sTraps = sTraps + 1; };
  ::sigaction(SIGTRAP, &onTrap, &previous);
  Tarn::Broadcaster broadcaster;
  {
    // Checks that hold call none of the reporting functions.
    ContractDialogRecorder dialog;
    RecordingListener plain("plain");
    broadcaster.AddListener(&plain);
    EXPECT_TRUE(broadcaster.HasListener(&plain));
    broadcaster.RemoveListener(&plain, true);
    EXPECT_EQ(dialog.Count() + sThrowErrorCalls.size() + sDebuggerQueries, 0u);
  }
  for (const bool answer : {false, true}) {
    for (const bool debugger : {false, true}) {
      SCOPED_TRACE(std::string("dialog answers ") + (answer ? "break" : "continue") +
                   (debugger ? ", debugger attached" : ""));
      ContractDialogRecorder dialog(answer);
      sThrowErrorCalls.clear();
      sDebuggerQueries = 0;
      sTraps = 0;
      sPretendDebugger = debugger;
      broadcaster.AddListener(static_cast<Tarn::Listener*>(nullptr));
      sPretendDebugger = false;
      EXPECT_EQ(dialog.Count(), 1u);
      EXPECT_EQ(sDebuggerQueries, answer ? 1 : 0);
      EXPECT_EQ(sTraps, answer && debugger ? 1 : 0);
      ASSERT_EQ(sThrowErrorCalls.size(), 1u);
      const ThrowErrorCall& call = sThrowErrorCalls[0];
      EXPECT_EQ(call.level, 0);
      EXPECT_EQ(call.key, kKey);
      EXPECT_EQ(call.number, 105u);
      EXPECT_EQ(call.code, 25);
      EXPECT_TRUE(call.flag);
      EXPECT_TRUE(call.allValuesEmpty);
      EXPECT_EQ(call.trapsBefore, static_cast<int>(sTraps)) << "the report must follow the break";
    }
  }
  ::sigaction(SIGTRAP, &previous, nullptr);
  EXPECT_FALSE(broadcaster.HasListeners());
}

// Offers ISafeListener but no weak reference, so no broadcaster can hold it.
class Unweakable : public Tarn::ISafeListener {
public:
  std::int32_t AddRef() override { return ++mCount; }
  std::int32_t Release() override { return --mCount; }
  std::int32_t QueryInterface(const Tarn::IID& inIID, void** outInterface) override {
    *outInterface = inIID == Tarn::IID_ISafeListener ? this : nullptr;
    return *outInterface != nullptr ? Tarn::kInterfaceOK : Tarn::kNoInterface;
  }
  void ListenToMessage(const Tarn::Message&) override { ADD_FAILURE() << "a listener without weak reference heard"; }
  std::int32_t mCount = 0;
};

class WatchedStation : public Tarn::Station {
public:
  WatchedStation(const ImmutableString& inStationID, bool& outGone) : Station(inStationID), mGone(outGone) {}
  ~WatchedStation() override { mGone = true; }

private:
  bool& mGone;
};

// What every check site works on: a broadcaster, and a station that holds
// one listener.
struct Scene {
  Tarn::Broadcaster mBroadcaster;
  RecordingListener mStays{"stays"};
  RecordingListener mMover{"mover"};
  ImmutableString mStation = Tarn::StationRegistry::UniqueStationID();
  ImmutableString mUnregistered = Tarn::StationRegistry::UniqueStationID();
  Unweakable mUnweakable;
  boost::weak_ptr<Tarn::Listener> mExpiredBoost = boost::make_shared<RecordingListener>("gone");
  std::weak_ptr<Tarn::Listener> mExpiredStd = std::make_shared<RecordingListener>("gone");
};

struct Report {
  const char* mCondition;
  const char* mFunction;
};

struct Site {
  const char* mName;
  std::function<void(Scene&)> mCall;
  std::vector<Report> mReports;  // in order, when each report returns
  bool mMoverJoinsStation = false;  // what the call does when its reports return
};

constexpr char kBAdd[] = "Tarn::Broadcaster::AddListener";
constexpr char kBRemove[] = "Tarn::Broadcaster::RemoveListener";
constexpr char kURemove[] = "Tarn::StationUtils::RemoveListener";
constexpr char kUSwitch[] = "Tarn::StationUtils::SwitchStation";
constexpr char kNull[] = "inListener != NULL";
constexpr char kExpired[] = "inListener.lock() != NULL";
Tarn::Listener* const kNoListener = nullptr;

const std::vector<Site>& Sites() {
  static const std::vector<Site> sites = {
      {"Broadcaster::AddListener(null)", [](Scene& s) { s.mBroadcaster.AddListener(kNoListener); }, {{kNull, kBAdd}}},
      {"Broadcaster::AddListener(null safe)", [](Scene& s) { s.mBroadcaster.AddListener(Tarn::ISafeListenerRef()); },
       {{kNull, kBAdd}}},
      {"Broadcaster::AddListener(unweakable)",
       [](Scene& s) { s.mBroadcaster.AddListener(Tarn::ISafeListenerRef(&s.mUnweakable)); },
       {{"IWeakReferenceCapableRef(inListener) != NULL", kBAdd}}},
      {"Broadcaster::AddListener(expired boost)", [](Scene& s) { s.mBroadcaster.AddListener(s.mExpiredBoost); },
       {{kExpired, kBAdd}}},
      {"Broadcaster::AddListener(expired std)", [](Scene& s) { s.mBroadcaster.AddListener(s.mExpiredStd); },
       {{kExpired, kBAdd}}},
      {"Broadcaster::RemoveListener(null)", [](Scene& s) { s.mBroadcaster.RemoveListener(kNoListener, true); },
       {{kNull, kBRemove}}},
      {"Broadcaster::RemoveListener(null safe)",
       [](Scene& s) { s.mBroadcaster.RemoveListener(Tarn::ISafeListenerRef()); }, {{kNull, kBRemove}}},
      {"Broadcaster::RemoveListener(expired boost)", [](Scene& s) { s.mBroadcaster.RemoveListener(s.mExpiredBoost); },
       {{kExpired, kBRemove}}},
      {"Broadcaster::RemoveListener(expired std)", [](Scene& s) { s.mBroadcaster.RemoveListener(s.mExpiredStd); },
       {{kExpired, kBRemove}}},
      {"Broadcaster::HasListener(null)", [](Scene& s) { EXPECT_FALSE(s.mBroadcaster.HasListener(nullptr)); },
       {{"inListener", "Tarn::Broadcaster::HasListener"}}},
      // On a registered station the station's own removal reports again.
      {"StationUtils::RemoveListener(null)",
       [](Scene& s) { Tarn::StationUtils::RemoveListener(s.mStation, kNoListener); },
       {{kNull, kURemove}, {kNull, kBRemove}}},
      {"StationUtils::RemoveListener(null safe)",
       [](Scene& s) { Tarn::StationUtils::RemoveListener(s.mStation, Tarn::ISafeListenerRef()); },
       {{kNull, kURemove}, {kNull, kBRemove}}},
      {"StationUtils::RemoveListener(expired boost)",
       [](Scene& s) { Tarn::StationUtils::RemoveListener(s.mStation, s.mExpiredBoost); },
       {{kExpired, kURemove}, {kExpired, kBRemove}}},
      {"StationUtils::RemoveListener(expired std, unregistered)",
       [](Scene& s) { Tarn::StationUtils::RemoveListener(s.mUnregistered, s.mExpiredStd); }, {{kExpired, kURemove}}},
      {"StationUtils::SwitchStation(no IDs, null)",
       [](Scene&) { Tarn::StationUtils::SwitchStation(Tarn::kNoStation, Tarn::kNoStation, kNoListener); },
       {{"!inFromStationID.empty()", kUSwitch}, {"!inToStationID.empty()", kUSwitch}, {kNull, kUSwitch}}},
      {"StationUtils::SwitchStation(from no ID)",
       [](Scene& s) { Tarn::StationUtils::SwitchStation(Tarn::kNoStation, s.mStation, &s.mMover); },
       {{"!inFromStationID.empty()", kUSwitch}},
       true},
  };
  return sites;
}

// The source line that a report names holds the check of its condition.
std::string SourceLine(const ContractViolation& inViolation) {
  // Found from this file's own path: the compiler names each source relative
  // to the directory it ran in, and those differ between library and test.
  const std::string self = __FILE__;
  const std::size_t at = inViolation.file.find("Messaging/Src/");
  if (at == std::string::npos) return "";
  std::ifstream source(self.substr(0, self.rfind("Messaging/tests/")) + inViolation.file.substr(at));
  std::string text;
  for (int line = 1; line <= inViolation.line && std::getline(source, text); ++line) {
  }
  return text;
}

TEST(ContractCheck, EveryCheckSiteReportsItselfAndLeavesNothingBrokenWhetherTheReportReturnsOrThrows) {
  messaging_test::MainThreadGuard mainThread;
  Scene scene;
  bool stationGone = false;
  Tarn::StationRegistry::RegisterStation(new WatchedStation(scene.mStation, stationGone));
  Tarn::StationUtils::AddListener(scene.mStation, &scene.mStays);
  Tarn::Station* const station = Tarn::StationRegistry::FindStation(scene.mStation);
  std::set<std::pair<std::string, int>> sitesSeen;

  for (const bool throws : {false, true}) {
    for (const Site& site : Sites()) {
      SCOPED_TRACE(std::string(site.mName) + (throws ? ", report throws" : ", report returns"));
      ContractDialogRecorder dialog;
      messaging_test::ErrorRecorder returningReports;
      std::optional<messaging_test::DefaultErrorHandlerGuard> throwingReports;
      if (throws) throwingReports.emplace();
      const auto blocksBefore = SmallBlockAllocator::GetStatistics().blocksInUse;
      std::string thrown;
      try {
        site.mCall(scene);
      } catch (const kivcore::config::Error& error) {
        thrown = error.what();
      }

      const std::vector<ContractViolation> violations = dialog.Violations();
      const std::size_t expected = throws ? 1 : site.mReports.size();
      // A null safe listener may also fail the weak-reference check after the
      // null check; only its first report is fixed here.
      if (std::string(site.mName) != "Broadcaster::AddListener(null safe)") {
        EXPECT_EQ(violations.size(), expected);
      }
      for (std::size_t i = 0; i < std::min(expected, violations.size()); ++i) {
        EXPECT_EQ(violations[i].condition, site.mReports[i].mCondition);
        EXPECT_EQ(violations[i].function, site.mReports[i].mFunction);
        EXPECT_NE(SourceLine(violations[i]).find("TARN_CONTRACT_CHECK(" + violations[i].condition + ","),
                  std::string::npos)
            << violations[i].file << ":" << violations[i].line;
        sitesSeen.insert({violations[i].file, violations[i].line});
      }
      if (throws) {
        EXPECT_NE(thrown.find(site.mReports[0].mCondition), std::string::npos) << thrown;
        EXPECT_NE(thrown.find(site.mReports[0].mFunction), std::string::npos) << thrown;
        EXPECT_EQ(SmallBlockAllocator::GetStatistics().blocksInUse, blocksBefore) << "the stopped operation leaked";
      } else {
        EXPECT_EQ(thrown, "");
        EXPECT_EQ(returningReports.Count(), violations.size());
      }
      // Whatever a returned report let through is pruned by the next
      // broadcast; the station keeps its own listener, and only a switch
      // that has a listener and a destination moves it.
      scene.mBroadcaster.BroadcastMessage(messaging_test::PingMessage());
      EXPECT_FALSE(scene.mBroadcaster.HasListeners());
      EXPECT_TRUE(station->HasListener(&scene.mStays));
      EXPECT_EQ(station->HasListener(&scene.mMover), site.mMoverJoinsStation && !throws);
      station->RemoveListener(&scene.mMover, true);
      EXPECT_EQ(scene.mUnweakable.mCount, 0);
    }
  }
  // Sixteen calls reach seventeen sites, each at a line of its own.
  EXPECT_EQ(sitesSeen.size(), 17u);
  // Every StationUtils call released the station it retained.
  Tarn::StationRegistry::DisposeStation(scene.mStation);
  EXPECT_TRUE(stationGone);
}

TEST(NullInterfaceException, ACopyCarriesTheSameTextAndBothReturnTheirStorage) {
  const auto blocksBefore = SmallBlockAllocator::GetStatistics().blocksInUse;
  {
    const Tarn::NullInterfaceException original("ISafeListener, a detail long enough to need a block of its own");
    const Tarn::NullInterfaceException copy(original);
    const Tarn::Exception& base = copy;
    EXPECT_STREQ(base.what(),
                 "A NULL interface pointer has been dereferenced: ISafeListener, a detail long enough to need a block "
                 "of its own");
    EXPECT_STREQ(original.what(), copy.what());
    EXPECT_NE(original.what(), copy.what());
  }
  EXPECT_EQ(SmallBlockAllocator::GetStatistics().blocksInUse, blocksBefore);
}

}  // namespace
