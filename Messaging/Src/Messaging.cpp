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
  MessagingLock lock;
  if (sInitializeCount == 0) {
    sMainThreadAdaptor = kivcore::threads::RegisterCurrentThreadAsMainThread();
    for (const kivcore::utility::ImmutableString* stationID :
         {&kStation_Idle, &kStation_Repeat, &kStation_AppSuspend, &kStation_AppResume, &kStation_AboutDialog,
          &kStation_DirectoryChange, &kStation_PanicSave, &kStation_StatusBar, &kStation_ColorPicker,
          &kStation_LocateClip}) {
      StationRegistry::RegisterStation(*stationID, nullptr);
    }
  }
  ++sInitializeCount;
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
