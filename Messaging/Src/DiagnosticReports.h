// The library's side of Tarn::Diagnostics: the reports its failure paths
// make, and a contract report whose condition text is built at run time.
//
// Every function here is meant for a failure path only; ReportsOn is the one
// load such a path pays while reports are off.
#pragma once

#include <TarnMessaging/Diagnostics.h>
#include <TarnMessaging/Message.h>

#include <kivcore/ImmutableString.h>

#include <atomic>
#include <cstddef>
#include <string>

// The address the enclosing public function returns to: the host's call
// site. Only meaningful in a function that is not inlined into another of
// the library's, which holds for every exported entry point.
#define TARN_CALL_SITE() __builtin_return_address(0)

namespace Tarn::Diagnostics::Detail {

enum class Failure {
  kBroadcastOffMainThread,
  kUnregisteredStation,
  kRetainedAtTerminate,
  kListenersAtTerminate,
  kInitializeOffMainThread,  // inCount: the Initialize count it raised to
  kQueuedAtExit              // inCount: the calls still queued
};

extern std::atomic<bool> sReportsOn;

inline bool ReportsOn() noexcept { return sReportsOn.load(std::memory_order_relaxed); }

// Reports inFailure of inOperation (a qualified function name) on
// inStationID once per call site, when reports are on. inCount is the number
// of stations concerned (the Terminate reports), inDetail what is known of
// the first one. A null call site is the library's own call: not reported. kBroadcastOffMainThread and kUnregisteredStation made by
// the library's own code are not reported. Never throws.
void ReportSilentFailure(Failure inFailure, const void* inCallSite, const char* inOperation,
                         const kivcore::utility::ImmutableString& inStationID, std::size_t inCount = 0,
                         std::size_t inDetail = 0) noexcept;

// The contract-check procedure with a condition text made at run time (the
// message-ID collision names both types). Throws what ThrowError throws.
void ReportContractViolation(const std::string& inCondition, const char* inFile, const char* inFunction, int inLine);

// Whether an ID is registered (its station may not be made yet). Takes the
// registry's lock; defined with the registry.
bool IsStationRegistered(const kivcore::utility::ImmutableString& inStationID);

// ReportIfUnregistered's lookup and report, out of line.
void ReportUnregistered(const kivcore::utility::ImmutableString& inStationID, const void* inCallSite,
                        const char* inOperation) noexcept;

// Reports inOperation on an ID that no station is registered under, when
// reports are on (a factory that gave no station is the factory's business;
// the empty ID names no station on purpose). Inline, and looks the ID up
// only then, so that a post's check costs one relaxed load while reports are
// off. Never throws.
inline void ReportIfUnregistered(const kivcore::utility::ImmutableString& inStationID, const void* inCallSite,
                                 const char* inOperation) noexcept {
  if (ReportsOn()) ReportUnregistered(inStationID, inCallSite, inOperation);
}

}  // namespace Tarn::Diagnostics::Detail

namespace Tarn::StationRegistry {
// Terminate, with the host's call site for its reports.
void TerminateFrom(const void* inCallSite);
}  // namespace Tarn::StationRegistry

namespace Tarn::StationUtils {
// BroadcastMessage for a posted copy: a station disposed of since the post is
// an ordinary miss, not reported.
void BroadcastPostedCopy(const kivcore::utility::ImmutableString& inStationID, const Message& inMessage);
}  // namespace Tarn::StationUtils
