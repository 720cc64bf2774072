#include <TarnMessaging/Messaging.h>
#include <TarnMessaging/StationIDs.h>
#include <TarnMessaging/StationRegistry.h>

#include "ContractCheck.h"
#include "DiagnosticReports.h"

#include <kivcore/InitializerRegistry.h>
#include <kivcore/MainThread.h>

#include "PostKinds.h"

#include <boost/shared_ptr.hpp>

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <mutex>
#include <thread>

namespace Tarn {
namespace {

// The initialization lock guards the count and the adaptor only: no host
// code (a station's destructor, a queued call, a handler, an error handler)
// runs while it is held. The last Terminate instead marks the life as ending
// and runs its steps with the lock let go; an Initialize on another thread
// meanwhile waits for them (below), one on the same thread (from a queued
// call, say) goes ahead.
std::mutex sMessagingMutex;
std::condition_variable sLifeEnded;  // notified when sEndingOn is cleared
std::int32_t sInitializeCount = 0;   // guarded by sMessagingMutex
boost::shared_ptr<kivcore::threads::AsyncEventLoopAdaptor> sMainThreadAdaptor;  // guarded by sMessagingMutex
std::thread::id sEndingOn;  // the thread running the last Terminate's steps, if any; guarded by sMessagingMutex
// How long another thread's Initialize waits for those steps: they run host
// code, which may itself wait for that thread, so the wait is bounded, and
// the Initialize then fails with a report instead of hanging.
constexpr std::chrono::seconds kLifeEndWaitLimit{10};

// At exit, a library still initialized with calls queued tells the host
// that they were never delivered: a forgotten Terminate (or a loop that
// stopped too soon) otherwise shows no sign at all. Defined after the
// adaptor, so it runs before the adaptor is destroyed.
struct ExitCheck {
  ~ExitCheck() {
    if (sInitializeCount == 0 || !sMainThreadAdaptor || !Diagnostics::Detail::ReportsOn()) return;
    const std::size_t queued = sMainThreadAdaptor->PendingCallCount();
    if (queued == 0) return;
    // The check's own address stands in for a call site: Terminate was never
    // called, so there is none.
    Diagnostics::Detail::ReportSilentFailure(Diagnostics::Detail::Failure::kQueuedAtExit, this,
                                             "Tarn::Messaging::Terminate", kNoStation, queued);
  }
} sExitCheck;

// Enrols the library with the host's initializer registry; nothing runs at
// load.
const kivcore::config::InitializerRegistrar sRegistrar(
    "Tarn::Messaging", kivcore::config::EInitializerContextFlags(10),
    [](const kivcore::proplist::PropList&) {
      Messaging::Initialize();
      return true;
    },
    [] { Messaging::Terminate(); }, kivcore::config::InitializerDependencies{});

}  // namespace

namespace Messaging {

void Initialize() {
  std::size_t countedOffMainThread = 0;
  bool waitedTooLong = false;
  {
    std::unique_lock<std::mutex> lock(sMessagingMutex);
    if (sEndingOn != std::thread::id() && sEndingOn != std::this_thread::get_id()) {
      waitedTooLong = !sLifeEnded.wait_for(lock, kLifeEndWaitLimit, [] { return sEndingOn == std::thread::id(); });
    }
    if (!waitedTooLong) {
      if (sInitializeCount == 0) {
        sMainThreadAdaptor = kivcore::threads::RegisterCurrentThreadAsMainThread();
        for (const kivcore::utility::ImmutableString* stationID :
             {&kStation_Idle, &kStation_Repeat, &kStation_AppSuspend, &kStation_AppResume, &kStation_AboutDialog,
              &kStation_DirectoryChange, &kStation_PanicSave, &kStation_StatusBar, &kStation_ColorPicker,
              &kStation_LocateClip}) {
          StationRegistry::RegisterStation(*stationID, nullptr);
        }
      } else if (!kivcore::threads::CurrentThreadIsMainThread()) {
        countedOffMainThread = static_cast<std::size_t>(sInitializeCount) + 1;
      }
      ++sInitializeCount;
    }
  }
  // Reported once the lock is let go, since the host's handlers run.
  if (waitedTooLong) {
    const bool lastTerminateEnded = false;
    TARN_CONTRACT_CHECK(lastTerminateEnded, "Tarn::Messaging::Initialize");
  }
  if (countedOffMainThread != 0) {
    Diagnostics::Detail::ReportSilentFailure(Diagnostics::Detail::Failure::kInitializeOffMainThread, TARN_CALL_SITE(),
                                             "Tarn::Messaging::Initialize", kNoStation, countedOffMainThread);
  }
}

void Terminate() {
  boost::shared_ptr<kivcore::threads::AsyncEventLoopAdaptor> adaptor;
  bool balanced = true;
  {
    const std::lock_guard<std::mutex> lock(sMessagingMutex);
    // One more Terminate than Initialize would leave a count that no later
    // Initialize brings up: refused.
    balanced = sInitializeCount > 0;
    if (balanced && --sInitializeCount != 0) return;
    if (balanced) {
      sEndingOn = std::this_thread::get_id();
      adaptor = sMainThreadAdaptor;
    }
  }
  if (!balanced) {
    TARN_CONTRACT_CHECK(balanced, "Tarn::Messaging::Terminate");
    return;
  }
  // However the steps end (a queued call may throw), the life has ended and
  // a waiting Initialize goes ahead.
  struct Ended {
    ~Ended() {
      {
        const std::lock_guard<std::mutex> lock(sMessagingMutex);
        sEndingOn = std::thread::id();
      }
      sLifeEnded.notify_all();
    }
  } ended;
  // The host's call site, for the reports of what Terminate finds left over.
  StationRegistry::TerminateFrom(TARN_CALL_SITE());
  // Posts still queued find no station now and deliver nothing; running them
  // frees their copies.
  if (adaptor) adaptor->RunPendingCalls();
  {
    const std::lock_guard<std::mutex> lock(sMessagingMutex);
    // A queued call may have initialized the library again; it keeps the
    // main thread it registered then.
    if (sInitializeCount != 0) return;
    sMainThreadAdaptor.reset();
  }
  adaptor.reset();
  // Idle-time posts wait for an idle broadcast that no station can make now.
  Detail::DropIdlePosts();
}

}  // namespace Messaging
}  // namespace Tarn
