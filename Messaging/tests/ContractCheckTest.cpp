// Misuse reported through the contract check: the reporting procedure once,
// then every check site of the library, with the report returning (the
// operation goes on safely) and with the report throwing (the operation
// stops at the check, changes nothing and leaks nothing).
//
// The executable interposes kivcore's ThrowError and IsDebuggerAttached: its
// definitions are found before the library's, record what they were given
// and forward to kivcore's own (dlsym(RTLD_NEXT)). Only so can a test see the
// replacement values and whether a debugger was asked for.
#include "StationTestSupport.h"

#include <TarnMessaging.h>

#include <boost/make_shared.hpp>

#include <gtest/gtest.h>

#include <dlfcn.h>

#include <algorithm>
#include <csignal>
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
std::vector<std::string> sReports;  // what ThrowError was given; the tests report on one thread only
int sDebuggerQueries = 0;
bool sPretendDebugger = false;
volatile std::sig_atomic_t sTraps = 0;
}  // namespace

namespace kivcore::config {
void ThrowError(ErrorLevel inLevel, const char* inKey, unsigned int inNumber, int inCode, bool inFlag,
                const ReplacementValue& inValue1, const ReplacementValue& inValue2, const ReplacementValue& inValue3,
                const ReplacementValue& inValue4) {
  const int empty = inValue1.empty() + inValue2.empty() + inValue3.empty() + inValue4.empty();
  sReports.push_back(std::to_string(inLevel) + " " + inKey + " " + std::to_string(inNumber) + " " +
                     std::to_string(inCode) + " " + std::to_string(inFlag) + ", " + std::to_string(empty) +
                     " empty values, after " + std::to_string(sTraps) + " breaks");
  using Real = void (*)(ErrorLevel, const char*, unsigned int, int, bool, const ReplacementValue&,
                        const ReplacementValue&, const ReplacementValue&, const ReplacementValue&);
  static const auto real =
      reinterpret_cast<Real>(::dlsym(RTLD_NEXT, "_ZN7kivcore6config10ThrowErrorEiPKcjibRKNS0_16ReplacementValueES5_S5_S5_"));
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

TEST(ContractCheck, AFailedCheckShowsTheDialogBreaksOnlyWhenAskedUnderADebuggerAndReportsOnce) {
  messaging_test::ErrorRecorder errors;
  struct sigaction previous {};
  struct sigaction onTrap {};
  onTrap.sa_handler = [](int) { sTraps = sTraps + 1; };
  ::sigaction(SIGTRAP, &onTrap, &previous);
  Tarn::Broadcaster broadcaster;
  RecordingListener plain("plain");
  ContractDialogRecorder holding;
  broadcaster.AddListener(&plain);  // checks that hold call none of the reporting functions
  EXPECT_TRUE(broadcaster.HasListener(&plain));
  broadcaster.RemoveListener(&plain, true);
  EXPECT_EQ(holding.Count() + sReports.size() + sDebuggerQueries, 0u);
  for (const bool answer : {false, true}) {
    for (const bool debugger : {false, true}) {
      SCOPED_TRACE(std::string("dialog answers ") + (answer ? "break" : "continue") + (debugger ? ", debugger" : ""));
      ContractDialogRecorder dialog(answer);
      sReports.clear();
      sDebuggerQueries = 0;
      sTraps = 0;
      sPretendDebugger = debugger;
      broadcaster.AddListener(static_cast<Tarn::Listener*>(nullptr));
      sPretendDebugger = false;
      EXPECT_EQ(dialog.Count(), 1u);
      EXPECT_EQ(sDebuggerQueries, answer ? 1 : 0);
      EXPECT_EQ(sReports, std::vector<std::string>{"0 $$$/kivcore/utility/Error/Contract/InputContractViolation=An "
                                                   "input contract violation has occurred! 105 25 1, 4 empty values, "
                                                   "after " + std::string(answer && debugger ? "1" : "0") + " breaks"});
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

struct Site {
  const char* mName;
  std::function<void(Scene&)> mCall;
  std::vector<std::pair<std::string, std::string>> mReports;  // condition and function, when each report returns
  bool mMoverJoinsStation = false;                             // what the call does when its reports return
};

const char kBAdd[] = "Tarn::Broadcaster::AddListener", kBRemove[] = "Tarn::Broadcaster::RemoveListener",
           kURemove[] = "Tarn::StationUtils::RemoveListener", kUSwitch[] = "Tarn::StationUtils::SwitchStation",
           kNull[] = "inListener != NULL", kExpired[] = "inListener.lock() != NULL";
Tarn::Listener* const kNoListener = nullptr;
namespace Utils = Tarn::StationUtils;

const std::vector<Site> kSites = {
    {"Broadcaster::AddListener(null)", [](Scene& s) { s.mBroadcaster.AddListener(kNoListener); }, {{kNull, kBAdd}}},
    {"Broadcaster::AddListener(null safe)", [](Scene& s) { s.mBroadcaster.AddListener(Tarn::ISafeListenerRef()); },
     {{kNull, kBAdd}}},
    {"Broadcaster::AddListener(unweakable)",
     [](Scene& s) { s.mBroadcaster.AddListener(Tarn::ISafeListenerRef(&s.mUnweakable)); },
     {{"IWeakReferenceCapableRef(inListener) != NULL", kBAdd}}},
    {"Broadcaster::AddListener(boost)", [](Scene& s) { s.mBroadcaster.AddListener(s.mExpiredBoost); },
     {{kExpired, kBAdd}}},
    {"Broadcaster::AddListener(std)", [](Scene& s) { s.mBroadcaster.AddListener(s.mExpiredStd); }, {{kExpired, kBAdd}}},
    {"Broadcaster::RemoveListener(null)", [](Scene& s) { s.mBroadcaster.RemoveListener(kNoListener, true); },
     {{kNull, kBRemove}}},
    {"Broadcaster::RemoveListener(null safe)", [](Scene& s) { s.mBroadcaster.RemoveListener(Tarn::ISafeListenerRef()); },
     {{kNull, kBRemove}}},
    {"Broadcaster::RemoveListener(boost)", [](Scene& s) { s.mBroadcaster.RemoveListener(s.mExpiredBoost); },
     {{kExpired, kBRemove}}},
    {"Broadcaster::RemoveListener(std)", [](Scene& s) { s.mBroadcaster.RemoveListener(s.mExpiredStd); },
     {{kExpired, kBRemove}}},
    {"Broadcaster::HasListener(null)", [](Scene& s) { EXPECT_FALSE(s.mBroadcaster.HasListener(nullptr)); },
     {{"inListener", "Tarn::Broadcaster::HasListener"}}},
    // On a registered station, the station's own removal reports again.
    {"StationUtils::RemoveListener(null)", [](Scene& s) { Utils::RemoveListener(s.mStation, kNoListener); },
     {{kNull, kURemove}, {kNull, kBRemove}}},
    {"StationUtils::RemoveListener(null safe)",
     [](Scene& s) { Utils::RemoveListener(s.mStation, Tarn::ISafeListenerRef()); },
     {{kNull, kURemove}, {kNull, kBRemove}}},
    {"StationUtils::RemoveListener(boost)", [](Scene& s) { Utils::RemoveListener(s.mStation, s.mExpiredBoost); },
     {{kExpired, kURemove}, {kExpired, kBRemove}}},
    {"StationUtils::RemoveListener(std, unregistered)",
     [](Scene& s) { Utils::RemoveListener(s.mUnregistered, s.mExpiredStd); }, {{kExpired, kURemove}}},
    {"StationUtils::SwitchStation(no IDs, null)",
     [](Scene&) { Utils::SwitchStation(Tarn::kNoStation, Tarn::kNoStation, kNoListener); },
     {{"!inFromStationID.empty()", kUSwitch}, {"!inToStationID.empty()", kUSwitch}, {kNull, kUSwitch}}},
    {"StationUtils::SwitchStation(from no ID)",
     [](Scene& s) { Utils::SwitchStation(Tarn::kNoStation, s.mStation, &s.mMover); },
     {{"!inFromStationID.empty()", kUSwitch}}, true},
};

// The source line that a report names. Found from this file's own path: the
// compiler names each source relative to the directory it ran in.
std::string SourceLine(const ContractViolation& inViolation) {
  const std::string self = __FILE__;
  const std::size_t at = inViolation.file.find("Messaging/Src/");
  std::ifstream source(self.substr(0, self.rfind("Messaging/tests/")) + inViolation.file.substr(std::min(at, inViolation.file.size())));
  std::string text;
  for (int line = 1; line <= inViolation.line && std::getline(source, text); ++line) {
  }
  return text;
}

class ContractCheckSites : public station_test::RegistryTest {};

TEST_F(ContractCheckSites, EachReportsItselfAndLeavesNothingBrokenWhetherTheReportReturnsOrThrows) {
  Scene scene;
  Tarn::StationRegistry::RegisterStation(new station_test::CountedStation(scene.mStation));
  Utils::AddListener(scene.mStation, &scene.mStays);
  Tarn::Station* const station = Tarn::StationRegistry::FindStation(scene.mStation);
  std::set<std::pair<std::string, int>> linesSeen;
  for (const bool throws : {false, true}) {
    for (const Site& site : kSites) {
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
      // A null safe listener may fail the weak-reference check too: only its
      // first report is fixed here.
      if (std::string(site.mName) != "Broadcaster::AddListener(null safe)") {
        EXPECT_EQ(violations.size(), expected);
      }
      for (std::size_t i = 0; i < std::min(expected, violations.size()); ++i) {
        EXPECT_EQ(violations[i].condition, site.mReports[i].first);
        EXPECT_EQ(violations[i].function, site.mReports[i].second);
        EXPECT_NE(SourceLine(violations[i]).find("TARN_CONTRACT_CHECK(" + violations[i].condition + ","),
                  std::string::npos)
            << violations[i].file << ":" << violations[i].line;
        linesSeen.insert({violations[i].file, violations[i].line});
      }
      if (throws) {
        EXPECT_NE(thrown.find(site.mReports[0].first), std::string::npos) << thrown;
        EXPECT_NE(thrown.find(site.mReports[0].second), std::string::npos) << thrown;
        EXPECT_EQ(SmallBlockAllocator::GetStatistics().blocksInUse, blocksBefore) << "the stopped operation leaked";
      } else {
        EXPECT_EQ(returningReports.Count(), violations.size());
      }
      // What a returned report let through is pruned by the next broadcast;
      // the station keeps its listener, and only a switch with a listener
      // and a destination moves one.
      scene.mBroadcaster.BroadcastMessage(messaging_test::PingMessage());
      EXPECT_FALSE(scene.mBroadcaster.HasListeners());
      EXPECT_TRUE(station->HasListener(&scene.mStays));
      EXPECT_EQ(station->HasListener(&scene.mMover), site.mMoverJoinsStation && !throws);
      station->RemoveListener(&scene.mMover, true);
      EXPECT_EQ(scene.mUnweakable.mCount, 0);
    }
  }
  EXPECT_EQ(linesSeen.size(), 17u);  // sixteen calls reach seventeen sites
  // Every StationUtils call released the station it retained.
  Tarn::StationRegistry::DisposeStation(scene.mStation);
  EXPECT_EQ(station_test::StationLog::Destructions(), 1);
}

TEST(NullInterfaceException, ACopyCarriesTheSameTextAndBothReturnTheirStorage) {
  const auto blocksBefore = SmallBlockAllocator::GetStatistics().blocksInUse;
  {
    const Tarn::NullInterfaceException original("ISafeListener, a detail long enough to need a block of its own");
    const Tarn::NullInterfaceException copy(original);
    EXPECT_STREQ(static_cast<const Tarn::Exception&>(copy).what(),
                 "A NULL interface pointer has been dereferenced: ISafeListener, a detail long enough to need a block "
                 "of its own");
    EXPECT_STREQ(original.what(), copy.what());
    EXPECT_NE(original.what(), copy.what());
  }
  EXPECT_EQ(SmallBlockAllocator::GetStatistics().blocksInUse, blocksBefore);
}

}  // namespace
