#include <TarnMessaging/Messaging.h>
#include <TarnMessaging/StationIDs.h>
#include <TarnMessaging/StationRegistry.h>

#include "DiagnosticReports.h"

#include <kivcore/InitializerRegistry.h>
#include <kivcore/MainThread.h>
#include <kivcore/RecursiveMutex.h>

#include "PostKinds.h"

#include <boost/shared_ptr.hpp>

#include <cstdint>

namespace Tarn {
namespace {

kivcore::threads::RecursiveMutex sMessagingMutex;
std::int32_t sInitializeCount = 0;  // guarded by sMessagingMutex
boost::shared_ptr<kivcore::threads::AsyncEventLoopAdaptor> sMainThreadAdaptor;  // guarded by sMessagingMutex

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

class MessagingLock {
public:
  MessagingLock() { sMessagingMutex.Lock(nullptr); }
  ~MessagingLock() { sMessagingMutex.Unlock(); }
  MessagingLock(const MessagingLock&) = delete;
  MessagingLock& operator=(const MessagingLock&) = delete;
};

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
  {
    MessagingLock lock;
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
  // Reported once the lock is let go, since the host's error handler runs.
  if (countedOffMainThread != 0) {
    Diagnostics::Detail::ReportSilentFailure(Diagnostics::Detail::Failure::kInitializeOffMainThread, TARN_CALL_SITE(),
                                             "Tarn::Messaging::Initialize", kNoStation, countedOffMainThread);
  }
}

void Terminate() {
  MessagingLock lock;
  if (--sInitializeCount != 0) return;
  // The host's call site, for the reports of what Terminate finds left over.
  StationRegistry::TerminateFrom(TARN_CALL_SITE());
  // Posts still queued find no station now and deliver nothing; running them
  // frees their copies.
  if (sMainThreadAdaptor) sMainThreadAdaptor->RunPendingCalls();
  // A pending call may have initialized the library again; it keeps the
  // main thread it registered then.
  if (sInitializeCount != 0) return;
  sMainThreadAdaptor.reset();
  // Idle-time posts wait for an idle broadcast that no station can make now.
  Detail::DropIdlePosts();
}

}  // namespace Messaging
}  // namespace Tarn
