// Misuse reported through the contract check: the reporting procedure once,
// then every check site of the library, with the report returning (the
// operation goes on safely) and with the report throwing (the operation
// stops at the check, changes nothing and leaks nothing).
//
// The executable interposes kivcore's IsDebuggerAttached (its definition is
// found before kivcore's own), so that a test can pretend a debugger is
// attached and see whether the library asked.
#include "DiagnosticsTestSupport.h"
#include "StationTestSupport.h"

#include <boost/make_shared.hpp>

#include <csignal>
#include <set>

using kivcore::utility::ImmutableString;
using kivcore::utility::SmallBlockAllocator;
using namespace messaging_test;

static int sDebuggerQueries = 0;
static bool sPretendDebugger = false;
static volatile std::sig_atomic_t sTraps = 0;

// Interposed: found before kivcore's own definition.
namespace kivcore::debug {
bool IsDebuggerAttached() {
  ++sDebuggerQueries;
  return sPretendDebugger;
}
}  // namespace kivcore::debug

namespace {

TEST(ContractCheck, AFailedCheckShowsTheDialogBreaksOnlyWhenAskedUnderADebuggerAndReportsOnce) {
  std::vector<std::string> reports;
  const auto previousHandler = kivcore::config::SetErrorHandler([&](const kivcore::config::ErrorReport& inReport) {
    reports.push_back(std::to_string(inReport.level) + " " + inReport.key + " " + std::to_string(inReport.number) +
                      " " + std::to_string(inReport.code) + " " + std::to_string(inReport.flag) + " after " +
                      std::to_string(sTraps) + " breaks");
  });
  struct sigaction previous {}, onTrap {};
  onTrap.sa_handler = [](int) { sTraps = sTraps + 1; };
  ::sigaction(SIGTRAP, &onTrap, &previous);
  Tarn::Broadcaster broadcaster;
  for (const bool answer : {false, true}) {
    for (const bool debugger : {false, true}) {
      SCOPED_TRACE(std::string("dialog answers ") + (answer ? "break" : "continue") + (debugger ? ", debugger" : ""));
      ContractDialogRecorder dialog(answer);
      reports.clear();
      sDebuggerQueries = sTraps = 0;
      sPretendDebugger = debugger;
      broadcaster.AddListener(static_cast<Tarn::Listener*>(nullptr));
      sPretendDebugger = false;
      EXPECT_EQ(dialog.Count(), 1u);
      EXPECT_EQ(sDebuggerQueries, answer ? 1 : 0);
      EXPECT_EQ(reports, std::vector<std::string>{"0 $$$/kivcore/utility/Error/Contract/InputContractViolation=An "
                                                  "input contract violation has occurred! 105 25 1 after " +
                                                  std::string(answer && debugger ? "1" : "0") + " breaks"});
    }
  }
  ::sigaction(SIGTRAP, &previous, nullptr);
  kivcore::config::SetErrorHandler(previousHandler);
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
  RecordingListener mStays{"stays"}, mMover{"mover"};
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

// Named by the object called (b: a broadcaster, u: the station utilities)
// and the argument given.
const std::vector<Site> kSites = {
    {"b.Add(null)", [](Scene& s) { s.mBroadcaster.AddListener(kNoListener); }, {{kNull, kBAdd}}},
    // Both checks run for a null safe listener.
    {"b.Add(null safe)", [](Scene& s) { s.mBroadcaster.AddListener(Tarn::ISafeListenerRef()); },
     {{kNull, kBAdd}, {"IWeakReferenceCapableRef(inListener) != NULL", kBAdd}}},
    {"b.Add(unweakable)", [](Scene& s) { s.mBroadcaster.AddListener(Tarn::ISafeListenerRef(&s.mUnweakable)); },
     {{"IWeakReferenceCapableRef(inListener) != NULL", kBAdd}}},
    {"b.Add(boost)", [](Scene& s) { s.mBroadcaster.AddListener(s.mExpiredBoost); }, {{kExpired, kBAdd}}},
    {"b.Add(std)", [](Scene& s) { s.mBroadcaster.AddListener(s.mExpiredStd); }, {{kExpired, kBAdd}}},
    {"b.Remove(null)", [](Scene& s) { s.mBroadcaster.RemoveListener(kNoListener, true); }, {{kNull, kBRemove}}},
    {"b.Remove(null safe)", [](Scene& s) { s.mBroadcaster.RemoveListener(Tarn::ISafeListenerRef()); },
     {{kNull, kBRemove}}},
    {"b.Remove(boost)", [](Scene& s) { s.mBroadcaster.RemoveListener(s.mExpiredBoost); }, {{kExpired, kBRemove}}},
    {"b.Remove(std)", [](Scene& s) { s.mBroadcaster.RemoveListener(s.mExpiredStd); }, {{kExpired, kBRemove}}},
    {"b.Has(null)", [](Scene& s) { EXPECT_FALSE(s.mBroadcaster.HasListener(nullptr)); },
     {{"inListener", "Tarn::Broadcaster::HasListener"}}},
    // On a registered station, the station's own removal reports again.
    {"u.Remove(null)", [](Scene& s) { Utils::RemoveListener(s.mStation, kNoListener); },
     {{kNull, kURemove}, {kNull, kBRemove}}},
    {"u.Remove(null safe)", [](Scene& s) { Utils::RemoveListener(s.mStation, Tarn::ISafeListenerRef()); },
     {{kNull, kURemove}, {kNull, kBRemove}}},
    {"u.Remove(boost)", [](Scene& s) { Utils::RemoveListener(s.mStation, s.mExpiredBoost); },
     {{kExpired, kURemove}, {kExpired, kBRemove}}},
    {"u.Remove(std, unregistered)", [](Scene& s) { Utils::RemoveListener(s.mUnregistered, s.mExpiredStd); },
     {{kExpired, kURemove}}},
    {"u.Switch(no IDs, null)", [](Scene&) { Utils::SwitchStation(Tarn::kNoStation, Tarn::kNoStation, kNoListener); },
     {{"!inFromStationID.empty()", kUSwitch}, {"!inToStationID.empty()", kUSwitch}, {kNull, kUSwitch}}},
    {"u.Switch(from no ID)", [](Scene& s) { Utils::SwitchStation(Tarn::kNoStation, s.mStation, &s.mMover); },
     {{"!inFromStationID.empty()", kUSwitch}}, true},
    // Off the main thread the post's broadcast would be dropped: it must stay queued.
    {"u.Flush(worker)", [](Scene& s) {
       Utils::PostMessageToUIThread(s.mStation, messaging_test::PingMessage(), true);
       std::exception_ptr thrown;
       station_test::RunOnWorker([&thrown] {
         try {
           Utils::FlushPostedMessagesOnUIThread();
         } catch (...) {
           thrown = std::current_exception();
         }
       });
       const int heard = s.mStays.Calls();
       Utils::FlushPostedMessagesOnUIThread();
       EXPECT_EQ(s.mStays.Calls(), heard + 1) << "the post was lost";
       if (thrown) std::rethrow_exception(thrown);
     },
     {{"onMainThread", "Tarn::StationUtils::FlushPostedMessagesOnUIThread"}}},
};

class ContractCheckSites : public station_test::RegistryTest {};

TEST_F(ContractCheckSites, EachReportsItselfAndLeavesNothingBrokenWhetherTheReportReturnsOrThrows) {
  // Only contract reports are counted here; one site works on an unregistered ID.
  const messaging_test::SilentFailureReportsSetting quiet(Tarn::Diagnostics::SilentFailureReports::kOff);
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
      const auto violations = dialog.Entries();
      const std::size_t expected = throws ? 1 : site.mReports.size();
      EXPECT_EQ(violations.size(), expected);
      for (std::size_t i = 0; i < expected && i < violations.size(); ++i) {
        EXPECT_EQ(violations[i].condition + " in " + violations[i].function,
                  site.mReports[i].first + " in " + site.mReports[i].second);
        const std::string& function = site.mReports[i].second;  // Tarn::<Family>::<Operation>, in <Family>.cpp
        EXPECT_NE(violations[i].file.find("Messaging/Src/" + function.substr(6, function.rfind("::") - 6) + ".cpp"),
                  std::string::npos) << violations[i].file;
        linesSeen.insert({violations[i].file, violations[i].line});
      }
      if (throws) {
        EXPECT_NE(thrown.find(site.mReports[0].first + " in " + site.mReports[0].second), std::string::npos)
            << thrown;
        EXPECT_EQ(SmallBlockAllocator::GetStatistics().blocksInUse, blocksBefore) << "the stopped operation leaked";
      } else {
        EXPECT_EQ(returningReports.Count(), violations.size());
      }
      // What a returned report let through is pruned by the next broadcast;
      // only a switch with a listener and a destination moves one.
      scene.mBroadcaster.BroadcastMessage(messaging_test::PingMessage());
      EXPECT_FALSE(scene.mBroadcaster.HasListeners());
      EXPECT_TRUE(station->HasListener(&scene.mStays));
      EXPECT_EQ(station->HasListener(&scene.mMover), site.mMoverJoinsStation && !throws);
      station->RemoveListener(&scene.mMover, true);
      EXPECT_EQ(scene.mUnweakable.mCount, 0);
    }
  }
  EXPECT_EQ(linesSeen.size(), 18u);  // seventeen calls reach eighteen sites
  // Every StationUtils call released the station it retained.
  Tarn::StationRegistry::DisposeStation(scene.mStation);
  EXPECT_EQ(station_test::StationLog::Destructions(), 1);
}

// Dereferencing a null reference raises an exception that names the
// interface; a copy keeps the text.
TEST(NullInterface, DereferencingANullReferenceThrowsAnExceptionNamingTheInterface) {
  Tarn::ISafeListenerRef none;
  try {
    none->AddRef();
    ADD_FAILURE() << "nothing was thrown";
  } catch (const Tarn::NullInterfaceException& inError) {
    const Tarn::NullInterfaceException copy(inError);
    const std::string text = copy.what();
    EXPECT_EQ(text.rfind("A NULL interface pointer has been dereferenced: ", 0), 0u) << text;
    EXPECT_NE(text.find("ISafeListener"), std::string::npos) << text;
  }
}

}  // namespace
