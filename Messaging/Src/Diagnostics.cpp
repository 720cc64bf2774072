#include <TarnMessaging/Diagnostics.h>
#include <TarnMessaging/StationIDs.h>

#include "ContractCheck.h"
#include "DiagnosticReports.h"

#include <kivcore/Debug.h>
#include <kivcore/Error.h>

#include <dlfcn.h>

#include <csignal>
#include <cstdio>
#include <exception>
#include <mutex>
#include <set>
#include <utility>

namespace Tarn::Diagnostics {

namespace Detail {

#ifdef NDEBUG
std::atomic<bool> sReportsOn{false};
#else
std::atomic<bool> sReportsOn{true};
#endif

namespace {

// The call sites already reported, each with the failure it made. Never
// destroyed: a station retained past static destruction may still report.
// Its storage is the standard allocator's, not small blocks: it lives as long
// as the process and must not show in the library's block counts, by which
// hosts and tests find leaks.
struct ReportedSites {
  std::mutex mMutex;
  std::set<std::pair<const void*, Failure>> mSites;  // guarded by mMutex
};

ReportedSites& Sites() {
  static ReportedSites* const sSites = new ReportedSites;
  return *sSites;
}

// True the first time the pair is seen. A set that cannot grow reports
// again rather than never.
bool FirstReport(const void* inCallSite, Failure inFailure) noexcept {
  ReportedSites& sites = Sites();
  const std::lock_guard<std::mutex> lock(sites.mMutex);
  try {
    return sites.mSites.emplace(inCallSite, inFailure).second;
  } catch (...) {
    return true;
  }
}

// Whether inAddress lies in this library: the library's own calls of its
// public functions (a posted copy delivered to a station disposed of since,
// a timer detaching after Terminate) are ordinary misses, not a host's
// mistakes.
bool IsInsideLibrary(const void* inAddress) noexcept {
  Dl_info site{};
  Dl_info self{};
  if (dladdr(inAddress, &site) == 0) return false;
  if (dladdr(reinterpret_cast<const void*>(&FirstReport), &self) == 0) return false;
  return site.dli_fbase == self.dli_fbase;
}

bool IsWellKnownStation(const kivcore::utility::ImmutableString& inStationID) {
  for (const kivcore::utility::ImmutableString* stationID :
       {&kStation_Idle, &kStation_Repeat, &kStation_AppSuspend, &kStation_AppResume, &kStation_AboutDialog,
        &kStation_DirectoryChange, &kStation_PanicSave, &kStation_StatusBar, &kStation_ColorPicker,
        &kStation_LocateClip}) {
    if (*stationID == inStationID) return true;
  }
  return false;
}

std::string Quoted(const kivcore::utility::ImmutableString& inStationID) {
  return std::string("\"") + inStationID.c_str() + "\"";
}

std::string ReportKey(Failure inFailure, const char* inOperation, const kivcore::utility::ImmutableString& inStationID,
                      std::size_t inCount, std::size_t inDetail) {
  std::string key = kSilentFailureKeyPrefix;
  const std::string operation = inOperation;
  switch (inFailure) {
    case Failure::kBroadcastOffMainThread:
      key += "BroadcastOffMainThread=" + operation +
             (inStationID.empty() ? std::string() : " on station " + Quoted(inStationID)) +
             " was called off the main thread, where broadcasts deliver nothing: the message was dropped. "
             "Post it with Tarn::StationUtils::PostMessageToUIThread instead.";
      break;
    case Failure::kUnregisteredStation:
      if (IsWellKnownStation(inStationID)) {
        key += "BeforeInitialize=" + operation + " on station " + Quoted(inStationID) +
               " did nothing: the well-known stations are registered by Tarn::Messaging::Initialize, which has "
               "not run yet (or the last Terminate has). Call Tarn::Messaging::Initialize first.";
      } else {
        key += "UnregisteredStation=" + operation + " on station " + Quoted(inStationID) +
               " did nothing: no station is registered under this ID. Register it with "
               "Tarn::StationRegistry::RegisterStation first, and check that it was not disposed of already.";
      }
      break;
    case Failure::kRetainedAtTerminate:
      key += "RetainedAtTerminate=" + operation + " deleted " + std::to_string(inCount) +
             " station(s) still retained, the first " + Quoted(inStationID) + " " + std::to_string(inDetail) +
             " time(s): their users will find them gone. Balance every RetainStation with a ReleaseStation "
             "before the last Terminate.";
      break;
    case Failure::kListenersAtTerminate:
      key += "ListenersAtTerminate=" + operation + " deleted " + std::to_string(inCount) +
             " station(s) with listeners still attached, the first " + Quoted(inStationID) + " with " +
             std::to_string(inDetail) +
             ": they hear nothing more. Remove listeners (or end their subscriptions) before the last Terminate.";
      break;
    case Failure::kInitializeOffMainThread:
      key += "InitializeOffMainThread=" + operation + " on a thread that is not the main thread only counted (" +
             std::to_string(inCount) +
             " now): the main thread is still the one that made the first Initialize, and broadcasts from this "
             "thread deliver nothing. Post to the main thread instead, or make the first Initialize on the thread "
             "that runs your event loop.";
      break;
    case Failure::kQueuedAtExit:
      key += "QueuedAtExit=" + operation + " was not made before the process exited: " + std::to_string(inCount) +
             " posted call(s) were still queued and were never delivered. Run the main thread's pending calls "
             "(or an event-loop integration) until the work is done, then call Tarn::Messaging::Terminate once "
             "for every Initialize.";
      break;
  }
  return key;
}

}  // namespace

void ReportSilentFailure(Failure inFailure, const void* inCallSite, const char* inOperation,
                         const kivcore::utility::ImmutableString& inStationID, std::size_t inCount,
                         std::size_t inDetail) noexcept {
  if (!ReportsOn() || inCallSite == nullptr || !FirstReport(inCallSite, inFailure)) return;
  const bool ordinaryMiss =
      inFailure == Failure::kBroadcastOffMainThread || inFailure == Failure::kUnregisteredStation;
  if (ordinaryMiss && IsInsideLibrary(inCallSite)) return;
  try {
    const std::string key = ReportKey(inFailure, inOperation, inStationID, inCount, inDetail);
    const kivcore::config::ReplacementValue value1, value2, value3, value4;
    try {
      kivcore::config::ThrowError(1, key.c_str(), 0u, 0, false, value1, value2, value3, value4);
    } catch (const std::exception& inError) {
      // The call goes on as documented; a handler that throws (the default
      // one does) still gets the text seen.
      std::fprintf(stderr, "TarnMessaging: %s\n", inError.what());
    }
  } catch (...) {
    // Out of storage for the text, or a handler throwing something else: the
    // report is lost, the call is not.
  }
}

void ReportUnregistered(const kivcore::utility::ImmutableString& inStationID, const void* inCallSite,
                        const char* inOperation) noexcept {
  if (inStationID.empty()) return;
  try {
    if (IsStationRegistered(inStationID)) return;
  } catch (...) {
    return;
  }
  ReportSilentFailure(Failure::kUnregisteredStation, inCallSite, inOperation, inStationID);
}

void ReportContractViolation(const std::string& inCondition, const char* inFile, const char* inFunction, int inLine) {
  if (::kivcore::debug::BreakAfterContractDialog(inCondition.c_str(), inFile, inFunction, inLine) &&
      ::kivcore::debug::IsDebuggerAttached()) {
    ::raise(SIGTRAP);
  }
  const ::kivcore::config::ReplacementValue value1, value2, value3, value4;
  ::kivcore::config::ThrowError(0, TARN_CONTRACT_VIOLATION_KEY, 105u, 25, true, value1, value2, value3, value4);
}

}  // namespace Detail

SilentFailureReports SetSilentFailureReports(SilentFailureReports inSetting) noexcept {
  const bool previous = Detail::sReportsOn.exchange(inSetting == SilentFailureReports::kOn, std::memory_order_relaxed);
  return previous ? SilentFailureReports::kOn : SilentFailureReports::kOff;
}

SilentFailureReports GetSilentFailureReports() noexcept {
  return Detail::ReportsOn() ? SilentFailureReports::kOn : SilentFailureReports::kOff;
}

void ForgetReportedCallSites() {
  Detail::ReportedSites& sites = Detail::Sites();
  const std::lock_guard<std::mutex> lock(sites.mMutex);
  sites.mSites.clear();
}

}  // namespace Tarn::Diagnostics
