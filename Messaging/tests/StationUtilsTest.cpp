// Tarn::StationUtils: working on a station by its ID. Every function brackets
// its work with a retain and a release, does nothing for an ID that is not
// registered, and reports misuse before it looks the station up.
#include "StationTestSupport.h"

#include <boost/make_shared.hpp>

#include <fstream>
#include <memory>
#include <set>
#include <string>

namespace {

bool EndsWith(const std::string& inText, const std::string& inSuffix) {
  return inText.size() >= inSuffix.size() && inText.compare(inText.size() - inSuffix.size(), inSuffix.size(), inSuffix) == 0;
}

using namespace station_test;
namespace Registry = Tarn::StationRegistry;
namespace Utils = Tarn::StationUtils;
using messaging_test::CallLog;
using messaging_test::ContractDialogRecorder;
using messaging_test::CountedSafeListener;
using messaging_test::DefaultErrorHandlerGuard;
using messaging_test::ErrorRecorder;
using messaging_test::ListenerKind;
using messaging_test::RecordingListener;

constexpr const char* kRemoveListenerName = "Tarn::StationUtils::RemoveListener";
constexpr const char* kSwitchStationName = "Tarn::StationUtils::SwitchStation";
constexpr const char* kSourceFile = "Messaging/Src/StationUtils";

class StationUtilsTest : public RegistryTest {
protected:
  // Whether the station of inStationID is unretained: a main-thread disposal
  // then deletes it at once. Ends the station either way.
  static bool DisposedAtOnce(const ImmutableString& inStationID) {
    const int before = StationLog::Destructions();
    Registry::DisposeStation(inStationID);
    return StationLog::Destructions() == before + 1;
  }
};

// ---------------------------------------------------------------------------
// Unregistered IDs

TEST_F(StationUtilsTest, EveryFunctionIsASilentNoOpForAnUnregisteredId) {
  ContractDialogRecorder dialog;
  const ImmutableString id = Registry::UniqueStationID();
  const ImmutableString otherId = Registry::UniqueStationID();
  RecordingListener plain("plain");
  auto boostOwner = boost::make_shared<RecordingListener>("boost");
  auto stdOwner = std::make_shared<RecordingListener>("std");
  auto* safe = new CountedSafeListener("safe");
  Tarn::ISafeListenerRef safeRef(safe);
  const std::int32_t safeReferences = safe->RefCount();
  const auto blocksBefore = kivcore::utility::SmallBlockAllocator::GetStatistics().blocksInUse;

  Utils::AddListener(id, &plain);
  Utils::AddListener(id, boost::weak_ptr<Tarn::Listener>(boostOwner));
  Utils::AddListener(id, std::weak_ptr<Tarn::Listener>(stdOwner));
  Utils::AddListener(id, safeRef);
  Utils::BroadcastMessage(id, NumberMessage(1));
  Utils::PostMessageToUIThread(id, NumberMessage(2), false);
  EXPECT_FALSE(Utils::HasListeners(id));
  Utils::StopBroadcasting(id);
  Utils::StartBroadcasting(id);
  Utils::RetainStation(id);
  Utils::ReleaseStation(id);
  Utils::RemoveListener(id, &plain);
  Utils::RemoveListener(id, boost::weak_ptr<Tarn::Listener>(boostOwner));
  Utils::RemoveListener(id, std::weak_ptr<Tarn::Listener>(stdOwner));
  Utils::RemoveListener(id, safeRef);
  Utils::SwitchStation(id, otherId, &plain);

  EXPECT_EQ(dialog.Count(), 0u);
  EXPECT_EQ(Registry::FindStation(id), nullptr) << "a station utility registered the ID";
  EXPECT_EQ(Registry::FindStation(otherId), nullptr);
  EXPECT_EQ(plain.Calls() + boostOwner->Calls() + stdOwner->Calls() + safe->Calls(), 0);
  EXPECT_EQ(safe->RefCount(), safeReferences) << "a reference to the safe listener was kept or lost";
  EXPECT_EQ(boostOwner.use_count(), 1);
  EXPECT_EQ(stdOwner.use_count(), 1);
  EXPECT_EQ(kivcore::utility::SmallBlockAllocator::GetStatistics().blocksInUse, blocksBefore);
  EXPECT_EQ(Adaptor().PendingCallCount(), 0u);
}

// ---------------------------------------------------------------------------
// Attaching, detaching, broadcasting

class StationUtilsKindTest : public StationUtilsTest, public ::testing::WithParamInterface<ListenerKind> {};

// Attaches and detaches one listener of each kind by station ID.
void AddByKind(const ImmutableString& inStationID, ListenerKind inKind, RecordingListener& inPlain,
               const boost::shared_ptr<RecordingListener>& inBoost, const std::shared_ptr<RecordingListener>& inStd,
               const Tarn::ISafeListenerRef& inSafe) {
  switch (inKind) {
    case ListenerKind::kPlainPointer:
      Utils::AddListener(inStationID, &inPlain);
      break;
    case ListenerKind::kBoostWeak:
      Utils::AddListener(inStationID, boost::weak_ptr<Tarn::Listener>(inBoost));
      break;
    case ListenerKind::kStdWeak:
      Utils::AddListener(inStationID, std::weak_ptr<Tarn::Listener>(inStd));
      break;
    case ListenerKind::kSafe:
      Utils::AddListener(inStationID, inSafe);
      break;
  }
}

void RemoveByKind(const ImmutableString& inStationID, ListenerKind inKind, RecordingListener& inPlain,
                  const boost::shared_ptr<RecordingListener>& inBoost, const std::shared_ptr<RecordingListener>& inStd,
                  const Tarn::ISafeListenerRef& inSafe) {
  switch (inKind) {
    case ListenerKind::kPlainPointer:
      Utils::RemoveListener(inStationID, &inPlain);
      break;
    case ListenerKind::kBoostWeak:
      Utils::RemoveListener(inStationID, boost::weak_ptr<Tarn::Listener>(inBoost));
      break;
    case ListenerKind::kStdWeak:
      Utils::RemoveListener(inStationID, std::weak_ptr<Tarn::Listener>(inStd));
      break;
    case ListenerKind::kSafe:
      Utils::RemoveListener(inStationID, inSafe);
      break;
  }
}

TEST_P(StationUtilsKindTest, AddingByIdMakesTheStationAttachesAndLeavesItUnretained) {
  const ListenerKind kind = GetParam();
  const ImmutableString id = RegisterCounted();
  RecordingListener plain("plain");
  auto boostOwner = boost::make_shared<RecordingListener>("boost");
  auto stdOwner = std::make_shared<RecordingListener>("std");
  auto* safe = new CountedSafeListener("safe");
  Tarn::ISafeListenerRef safeRef(safe);
  const std::int32_t safeReferences = safe->RefCount();
  auto calls = [&] { return plain.Calls() + boostOwner->Calls() + stdOwner->Calls() + safe->Calls(); };

  AddByKind(id, kind, plain, boostOwner, stdOwner, safeRef);
  EXPECT_EQ(StationLog::Factories(), 1);
  EXPECT_TRUE(Utils::HasListeners(id));
  EXPECT_EQ(safe->RefCount(), safeReferences) << "the station holds a counted reference to a safe listener";

  Utils::BroadcastMessage(id, NumberMessage(1));
  EXPECT_EQ(calls(), 1);

  RemoveByKind(id, kind, plain, boostOwner, stdOwner, safeRef);
  EXPECT_FALSE(Utils::HasListeners(id));
  Utils::BroadcastMessage(id, NumberMessage(2));
  EXPECT_EQ(calls(), 1);
  EXPECT_FALSE(plain.HasBroadcaster(Registry::FindStation(id))) << "the back-link outlived the removal";
  EXPECT_EQ(safe->RefCount(), safeReferences);

  // Every call released what it retained.
  EXPECT_TRUE(DisposedAtOnce(id));
}

INSTANTIATE_TEST_SUITE_P(AllKinds, StationUtilsKindTest, ::testing::ValuesIn(messaging_test::kAllListenerKinds),
                         messaging_test::KindParamName());

TEST_F(StationUtilsTest, HasListenersMakesTheStationAndReleasesIt) {
  const ImmutableString id = RegisterCounted();
  EXPECT_FALSE(Utils::HasListeners(id));
  EXPECT_EQ(StationLog::Factories(), 1);
  EXPECT_TRUE(DisposedAtOnce(id));
}

TEST_F(StationUtilsTest, BroadcastOffTheMainThreadDeliversNothingAndReleasesTheStation) {
  const ImmutableString id = MakeCounted();
  RecordingListener listener("listener");
  Utils::AddListener(id, &listener);
  RunOnWorker([&] { Utils::BroadcastMessage(id, NumberMessage(1)); });
  EXPECT_EQ(listener.Calls(), 0);
  EXPECT_TRUE(DisposedAtOnce(id));
}

TEST_F(StationUtilsTest, RetainStationKeepsAStationFromAPendingDisposalUntilTheMatchingRelease) {
  const ImmutableString id = MakeCounted();
  RecordingListener listener("listener");
  Utils::AddListener(id, &listener);
  Utils::RetainStation(id);
  Utils::StopBroadcasting(id);

  Registry::DisposeStation(id);
  EXPECT_EQ(StationLog::Destructions(), 0);
  EXPECT_TRUE(Utils::HasListeners(id)) << "the retained station lost its listeners";
  Utils::BroadcastMessage(id, NumberMessage(1));
  EXPECT_EQ(listener.Calls(), 0) << "the retained station lost its stopped state";

  Utils::ReleaseStation(id);
  EXPECT_EQ(StationLog::Destructions(), 1);
  EXPECT_FALSE(Utils::HasListeners(id));
}

TEST_F(StationUtilsTest, ExceptionFromTheStationPassesToTheCallerAfterTheRelease) {
  DefaultErrorHandlerGuard defaultErrors;
  const ImmutableString id = MakeCounted();
  // The station's own check of the null listener throws through ThrowError.
  EXPECT_THROW(Utils::AddListener(id, static_cast<Tarn::Listener*>(nullptr)), kivcore::config::Error);
  EXPECT_TRUE(DisposedAtOnce(id)) << "the station stayed retained after the exception";
}

// ---------------------------------------------------------------------------
// Starting and stopping

TEST_F(StationUtilsTest, StoppedStationDropsBroadcastsInsteadOfDeferringThem) {
  const ImmutableString id = MakeCounted();
  MessageRecorder listener;
  Utils::AddListener(id, &listener);

  Utils::StopBroadcasting(id);
  Utils::BroadcastMessage(id, NumberMessage(1));
  EXPECT_EQ(listener.Count(), 0u);
  EXPECT_TRUE(Utils::HasListeners(id)) << "stopping detached the listeners";

  Utils::StartBroadcasting(id);
  EXPECT_EQ(listener.Count(), 0u) << "starting delivered what was broadcast while stopped";
  Utils::BroadcastMessage(id, NumberMessage(2));
  EXPECT_EQ(listener.Values(), std::vector<int>{2});
  EXPECT_TRUE(DisposedAtOnce(id)) << "stopping or starting left a retain standing";
}

TEST_F(StationUtilsTest, StationMadeAnewStartsBroadcasting) {
  const ImmutableString id = MakeCounted();
  Utils::StopBroadcasting(id);
  Registry::DisposeStation(id);
  Registry::RegisterStation(id, &CountingFactory);

  RecordingListener listener("listener");
  Utils::AddListener(id, &listener);
  Utils::BroadcastMessage(id, NumberMessage(1));
  EXPECT_EQ(listener.Calls(), 1);
}

// ---------------------------------------------------------------------------
// Switching stations

TEST_F(StationUtilsTest, SwitchStationMovesTheListenerFromOneStationToTheOther) {
  const ImmutableString from = MakeCounted();
  const ImmutableString to = MakeCounted();
  Tarn::Station* fromStation = Registry::FindStation(from);
  Tarn::Station* toStation = Registry::FindStation(to);
  RecordingListener listener("listener");
  Utils::AddListener(from, &listener);

  Utils::SwitchStation(from, to, &listener);
  EXPECT_FALSE(fromStation->HasListener(&listener));
  EXPECT_TRUE(toStation->HasListener(&listener));
  EXPECT_FALSE(listener.HasBroadcaster(fromStation));
  EXPECT_TRUE(listener.HasBroadcaster(toStation));

  Utils::BroadcastMessage(from, NumberMessage(1));
  EXPECT_EQ(listener.Calls(), 0);
  Utils::BroadcastMessage(to, NumberMessage(2));
  EXPECT_EQ(listener.Calls(), 1);
  EXPECT_TRUE(DisposedAtOnce(from));
  EXPECT_TRUE(DisposedAtOnce(to));
}

TEST_F(StationUtilsTest, SwitchStationToTheSameStationReaddsTheListenerAsTheNewest) {
  const ImmutableString id = MakeCounted();
  CallLog log;
  RecordingListener older("older", &log);
  RecordingListener newer("newer", &log);
  Utils::AddListener(id, &older);
  Utils::AddListener(id, &newer);
  Utils::BroadcastMessage(id, NumberMessage(1));
  ASSERT_EQ(log.Entries(), (std::vector<std::string>{"newer:1", "older:1"}));

  Utils::SwitchStation(id, id, &older);
  log.Clear();
  Utils::BroadcastMessage(id, NumberMessage(2));
  EXPECT_EQ(log.Entries(), (std::vector<std::string>{"older:2", "newer:2"}));
  EXPECT_TRUE(older.HasBroadcaster(Registry::FindStation(id)));
}

TEST_F(StationUtilsTest, SwitchStationBetweenRegisteredAndUnregisteredIds) {
  const ImmutableString registered = MakeCounted();
  const ImmutableString unregistered = Registry::UniqueStationID();
  RecordingListener listener("listener");

  // From an unregistered ID: the listener is simply added.
  Utils::SwitchStation(unregistered, registered, &listener);
  EXPECT_TRUE(Registry::FindStation(registered)->HasListener(&listener));

  // To an unregistered ID: the listener ends on no station.
  Utils::SwitchStation(registered, unregistered, &listener);
  EXPECT_FALSE(Utils::HasListeners(registered));
  EXPECT_FALSE(listener.HasBroadcaster(Registry::FindStation(registered)));
  EXPECT_EQ(Registry::FindStation(unregistered), nullptr);
}

// ---------------------------------------------------------------------------
// Contract checks

void ExpectStationUtilsReport(const messaging_test::ContractViolation& inViolation, const char* inCondition,
                              const char* inFunction) {
  EXPECT_EQ(inViolation.condition, inCondition);
  EXPECT_EQ(inViolation.function, inFunction);
  EXPECT_NE(inViolation.file.find(kSourceFile), std::string::npos) << inViolation.file;
}

TEST_F(StationUtilsTest, ExpiredWeakListenerIsReportedEvenForAnUnregisteredId) {
  ContractDialogRecorder dialog;
  ErrorRecorder errors;
  const ImmutableString id = Registry::UniqueStationID();
  boost::weak_ptr<Tarn::Listener> boostExpired = boost::make_shared<RecordingListener>("gone");
  std::weak_ptr<Tarn::Listener> stdExpired = std::make_shared<RecordingListener>("gone");
  ASSERT_TRUE(boostExpired.expired());

  Utils::RemoveListener(id, boostExpired);
  Utils::RemoveListener(id, stdExpired);
  const std::vector<messaging_test::ContractViolation> violations = dialog.Violations();
  ASSERT_EQ(violations.size(), 2u);
  ExpectStationUtilsReport(violations[0], "inListener.lock() != NULL", kRemoveListenerName);
  ExpectStationUtilsReport(violations[1], "inListener.lock() != NULL", kRemoveListenerName);

  const std::vector<kivcore::config::ErrorReport> reports = errors.Reports();
  ASSERT_EQ(reports.size(), 2u);
  for (const kivcore::config::ErrorReport& report : reports) {
    EXPECT_EQ(report.level, 0);
    EXPECT_EQ(report.key,
              "$$$/kivcore/utility/Error/Contract/InputContractViolation=An input contract violation has occurred!");
    EXPECT_EQ(report.number, 105u);
    EXPECT_EQ(report.code, 25);
    EXPECT_TRUE(report.flag);
  }
  EXPECT_EQ(Registry::FindStation(id), nullptr);
}

TEST_F(StationUtilsTest, ExpiredWeakListenerIsReportedBeforeTheStationIsLookedUp) {
  ContractDialogRecorder dialog;
  ErrorRecorder errors;
  const ImmutableString id = Registry::UniqueStationID();
  // The factory notes how many reports had been made when the lookup came.
  static std::size_t sReportsAtLookup;
  static ContractDialogRecorder* sDialog;
  sReportsAtLookup = 99;
  sDialog = &dialog;
  Registry::RegisterStation(id, [](const ImmutableString& inStationID) -> Tarn::Station* {
    sReportsAtLookup = sDialog->Count();
    return new CountedStation(inStationID);
  });

  boost::weak_ptr<Tarn::Listener> expired = boost::make_shared<RecordingListener>("gone");
  ASSERT_TRUE(expired.expired());
  Utils::RemoveListener(id, expired);
  EXPECT_EQ(sReportsAtLookup, 1u);
  sDialog = nullptr;
}

TEST_F(StationUtilsTest, ExpiredWeakListenerOnARegisteredStationIsReportedTwiceAndTheStationReleased) {
  ContractDialogRecorder dialog;
  ErrorRecorder errors;
  const ImmutableString id = MakeCounted();
  RecordingListener stays("stays");
  Utils::AddListener(id, &stays);

  std::weak_ptr<Tarn::Listener> expired = std::make_shared<RecordingListener>("gone");
  ASSERT_TRUE(expired.expired());
  Utils::RemoveListener(id, expired);
  const std::vector<messaging_test::ContractViolation> violations = dialog.Violations();
  ASSERT_EQ(violations.size(), 2u);
  ExpectStationUtilsReport(violations[0], "inListener.lock() != NULL", kRemoveListenerName);
  EXPECT_EQ(violations[1].condition, "inListener.lock() != NULL");
  EXPECT_EQ(violations[1].function, "Tarn::Broadcaster::RemoveListener");
  EXPECT_EQ(errors.Count(), 2u);
  EXPECT_TRUE(Utils::HasListeners(id)) << "removing an expired listener removed another";
  EXPECT_TRUE(DisposedAtOnce(id));
}

TEST_F(StationUtilsTest, NullListenerRemovalIsReportedAndChangesNothing) {
  ContractDialogRecorder dialog;
  ErrorRecorder errors;
  const ImmutableString id = MakeCounted();
  RecordingListener stays("stays");
  Utils::AddListener(id, &stays);

  Utils::RemoveListener(id, static_cast<Tarn::Listener*>(nullptr));
  Utils::RemoveListener(id, Tarn::ISafeListenerRef());
  // Each is reported here and then again by the station's own removal.
  const std::vector<messaging_test::ContractViolation> violations = dialog.Violations();
  ASSERT_EQ(violations.size(), 4u);
  ExpectStationUtilsReport(violations[0], "inListener != NULL", kRemoveListenerName);
  EXPECT_EQ(violations[1].function, "Tarn::Broadcaster::RemoveListener");
  ExpectStationUtilsReport(violations[2], "inListener != NULL", kRemoveListenerName);
  EXPECT_EQ(violations[3].function, "Tarn::Broadcaster::RemoveListener");
  EXPECT_TRUE(Registry::FindStation(id)->HasListener(&stays));
  EXPECT_TRUE(DisposedAtOnce(id));
}

TEST_F(StationUtilsTest, ThrowingReportLeavesTheStationUntouched) {
  DefaultErrorHandlerGuard defaultErrors;
  const ImmutableString id = RegisterCounted();
  EXPECT_THROW(Utils::RemoveListener(id, boost::weak_ptr<Tarn::Listener>()), kivcore::config::Error);
  EXPECT_THROW(Utils::RemoveListener(id, static_cast<Tarn::Listener*>(nullptr)), kivcore::config::Error);
  EXPECT_EQ(StationLog::Factories(), 0) << "the station was looked up before the argument was checked";
}

TEST_F(StationUtilsTest, SwitchStationReportsItsChecksInOrderAndWithoutListenerChangesNoStation) {
  ContractDialogRecorder dialog;
  ErrorRecorder errors;
  const ImmutableString from = MakeCounted();
  const ImmutableString to = MakeCounted();
  RecordingListener listener("listener");
  Utils::AddListener(from, &listener);

  Utils::SwitchStation(Tarn::kNoStation, Tarn::kNoStation, nullptr);
  std::vector<messaging_test::ContractViolation> violations = dialog.Violations();
  ASSERT_EQ(violations.size(), 3u);
  ExpectStationUtilsReport(violations[0], "!inFromStationID.empty()", kSwitchStationName);
  ExpectStationUtilsReport(violations[1], "!inToStationID.empty()", kSwitchStationName);
  ExpectStationUtilsReport(violations[2], "inListener != NULL", kSwitchStationName);
  EXPECT_EQ(errors.Count(), 3u);

  dialog.Clear();
  Utils::SwitchStation(from, to, nullptr);
  violations = dialog.Violations();
  ASSERT_EQ(violations.size(), 1u);
  ExpectStationUtilsReport(violations[0], "inListener != NULL", kSwitchStationName);
  EXPECT_TRUE(Registry::FindStation(from)->HasListener(&listener));
  EXPECT_FALSE(Utils::HasListeners(to));
}

TEST_F(StationUtilsTest, SwitchStationFromTheEmptyIdReportsAndStillAddsTheListener) {
  ContractDialogRecorder dialog;
  ErrorRecorder errors;
  const ImmutableString to = MakeCounted();
  RecordingListener listener("listener");

  Utils::SwitchStation(Tarn::kNoStation, to, &listener);
  ASSERT_EQ(dialog.Count(), 1u);
  EXPECT_EQ(dialog.Violations()[0].condition, "!inFromStationID.empty()");
  EXPECT_TRUE(Registry::FindStation(to)->HasListener(&listener));
}

// The check sites carry fixed line numbers, which hosts match in their error
// logs: RemoveListener 268 (boost), 291 (std), 221 (plain), 245 (safe);
// SwitchStation 315, 316, 325.
// Each report names the true site of its check: this source file, and a line
// that holds the check of the reported condition.
TEST_F(StationUtilsTest, ContractReportsNameTheTrueSourceLineOfEachCheck) {
  ContractDialogRecorder dialog;
  ErrorRecorder errors;
  const ImmutableString id = Registry::UniqueStationID();
  Utils::RemoveListener(id, boost::weak_ptr<Tarn::Listener>());
  Utils::RemoveListener(id, std::weak_ptr<Tarn::Listener>());
  Utils::RemoveListener(id, static_cast<Tarn::Listener*>(nullptr));
  Utils::RemoveListener(id, Tarn::ISafeListenerRef());
  Utils::SwitchStation(Tarn::kNoStation, Tarn::kNoStation, nullptr);

  const std::vector<messaging_test::ContractViolation> violations = dialog.Violations();
  ASSERT_EQ(7u, violations.size());
  std::set<int> distinctLines;
  for (const messaging_test::ContractViolation& violation : violations) {
    ASSERT_TRUE(EndsWith(violation.file, "Messaging/Src/StationUtils.cpp")) << violation.file;
    std::ifstream source(violation.file);
    ASSERT_TRUE(source.good()) << violation.file;
    std::string text;
    for (int line = 1; line <= violation.line && std::getline(source, text); ++line) {
    }
    EXPECT_NE(std::string::npos, text.find("TARN_CONTRACT_CHECK(" + violation.condition + ","))
        << "line " << violation.line << " is: " << text;
    distinctLines.insert(violation.line);
  }
  EXPECT_EQ(7u, distinctLines.size());
}

}  // namespace
