/// @file
/// Tarn::Diagnostics: reports of the mistakes that the library otherwise
/// answers with silence.
///
/// Several calls do nothing by design, and a new user's mistake then costs
/// nothing but a search. With silent-failure reports on, the library reports
/// each of these once per call site through kivcore's error reporting
/// (ThrowError), saying what happened and what to do instead:
///
/// - a broadcast made off the main thread, which is dropped (key
///   ".../BroadcastOffMainThread");
/// - a call by station ID on an ID that no station is registered under
///   (".../UnregisteredStation"), and in particular one on a well-known
///   station before Tarn::Messaging::Initialize (".../BeforeInitialize"). The
///   calls that report it: Tarn::Subscribe and Tarn::Attach (which return an
///   empty Registration); StationUtils' AddListener, RemoveListener,
///   BroadcastMessage, RetainStation, StartBroadcasting, StopBroadcasting and
///   SwitchStation (which do nothing); and every kind of post,
///   PostMessageToUIThread (both forms), PostCoalescedMessageToUIThread (both
///   forms) and PostMessageAtIdleTime, whose copy is still queued and is
///   dropped when it finds no station at its delivery;
/// - stations still retained, or with listeners still attached, when the
///   last Terminate deletes them (".../RetainedAtTerminate",
///   ".../ListenersAtTerminate");
/// - Tarn::Messaging::Initialize called again on another thread than the main
///   thread, which only counts and does not make that thread the main
///   thread (".../InitializeOffMainThread");
/// - a process that exits with the library still initialized and posted calls
///   still queued, which are never delivered: a forgotten Terminate, or a
///   loop that stopped too soon (".../QueuedAtExit", made during the
///   process's static destruction with no call site of the host's).
///
/// @code{.cpp}
///   Tarn::Diagnostics::SetSilentFailureReports(Tarn::Diagnostics::SilentFailureReports::kOn);
///   kivcore::config::SetErrorHandler([](const kivcore::config::ErrorReport& inReport) {
///     if (Tarn::Diagnostics::IsSilentFailureReport(inReport.key)) Log(inReport.key);
///   });
/// @endcode
///
/// Every report is a ThrowError call with error level 1, the numbers 0 and
/// 0, the flag false and a key beginning with kSilentFailureKeyPrefix; the
/// key's display text names the operation, the station ID and the remedy.
/// A report never changes what the call does: an exception that the error
/// handler throws (the default handler throws kivcore::config::Error) is
/// caught, and its text is written to standard error instead. A call site is
/// the address the public function returns to; calls that the library makes
/// itself (a posted message arriving after its station was disposed of, say)
/// are not reported.
///
/// Reports are on by default in builds of the library without NDEBUG and off
/// otherwise. While they are off, the library checks one relaxed flag on each
/// failure path and nothing on any other path.
///
/// Threading: every function may be called from any thread. Reports run on
/// the thread of the failing call, with no lock of the library held.
#pragma once

#include <TarnMessaging/Export.h>

#include <string>

namespace Tarn::Diagnostics {

/// Whether silent failures are reported.
enum class SilentFailureReports { kOff, kOn };

/// The beginning of the key of every silent-failure report.
inline constexpr char kSilentFailureKeyPrefix[] = "$$$/TarnMessaging/Diagnostics/";

/// Switches silent-failure reports on or off; returns the previous setting.
TARN_MESSAGING_API SilentFailureReports SetSilentFailureReports(SilentFailureReports inSetting) noexcept;
/// The current setting.
TARN_MESSAGING_API SilentFailureReports GetSilentFailureReports() noexcept;
/// Forgets which call sites have been reported, so that each reports once
/// more: for a host that unloads a plug-in (its addresses may be reused) and
/// for tests.
TARN_MESSAGING_API void ForgetReportedCallSites();

/// True when an error report's key is one of a silent-failure report.
inline bool IsSilentFailureReport(const std::string& inKey) {
  return inKey.compare(0, sizeof(kSilentFailureKeyPrefix) - 1, kSilentFailureKeyPrefix) == 0;
}

}  // namespace Tarn::Diagnostics
