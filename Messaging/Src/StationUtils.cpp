#include <TarnMessaging/Broadcaster.h>
#include <TarnMessaging/Listener.h>
#include <TarnMessaging/Station.h>
#include <TarnMessaging/StationRegistry.h>
#include <TarnMessaging/StationUtils.h>

#include "ContractCheck.h"
#include "DiagnosticReports.h"
#include "StationRetainer.h"

#include <kivcore/MainThread.h>

namespace Tarn {
namespace StationUtils {

namespace {

constexpr const char* kRemoveListenerName = "Tarn::StationUtils::RemoveListener";
constexpr const char* kSwitchStationName = "Tarn::StationUtils::SwitchStation";

// Whether a weak pointer can still be locked; the temporary is dropped at
// once, before the station is looked up.
template <class WeakPtr>
bool IsAlive(const WeakPtr& inListener) {
  return inListener.lock() != nullptr;
}

using Diagnostics::Detail::ReportIfUnregistered;

void RemoveAt(const ImmutableString& inStationID, Listener* inListener, const void* inCallSite) {
  StationRetainer station(inStationID);
  // The broadcaster checks and ignores a null listener itself.
  if (station) station->RemoveListener(inListener, true);
  else ReportIfUnregistered(inStationID, inCallSite, kRemoveListenerName);
}

template <class ListenerRef>
void AddAt(const ImmutableString& inStationID, const ListenerRef& inListener, const void* inCallSite) {
  StationRetainer station(inStationID);
  if (station) station->AddListener(inListener);
  else ReportIfUnregistered(inStationID, inCallSite, "Tarn::StationUtils::AddListener");
}

void BroadcastAt(const ImmutableString& inStationID, const Message& inMessage, const void* inCallSite) {
  // Nothing would be delivered, so the station is not even looked up.
  if (!kivcore::threads::CurrentThreadIsMainThread()) {
    Diagnostics::Detail::ReportSilentFailure(Diagnostics::Detail::Failure::kBroadcastOffMainThread, inCallSite,
                                             "Tarn::StationUtils::BroadcastMessage", inStationID);
    return;
  }
  StationRetainer station(inStationID);
  if (station) station->BroadcastMessage(inMessage);
  else ReportIfUnregistered(inStationID, inCallSite, "Tarn::StationUtils::BroadcastMessage");
}

}  // namespace

void AddListener(const ImmutableString& inStationID, const boost::weak_ptr<Listener>& inListener) {
  AddAt(inStationID, inListener, TARN_CALL_SITE());
}

void AddListener(const ImmutableString& inStationID, const std::weak_ptr<Listener>& inListener) {
  AddAt(inStationID, inListener, TARN_CALL_SITE());
}

void AddListener(const ImmutableString& inStationID, Listener* inListener) {
  AddAt(inStationID, inListener, TARN_CALL_SITE());
}

void AddListener(const ImmutableString& inStationID, InterfaceRef<ISafeListener> inListener) {
  AddAt(inStationID, inListener, TARN_CALL_SITE());
}

void RemoveListener(const ImmutableString& inStationID, const boost::weak_ptr<Listener>& inListener) {
  // An expired weak pointer never locks again, so the check may test it anew.
  if (!IsAlive(inListener)) TARN_CONTRACT_CHECK(inListener.lock() != NULL, kRemoveListenerName);
  StationRetainer station(inStationID);
  if (station) station->RemoveListener(inListener);
  else ReportIfUnregistered(inStationID, TARN_CALL_SITE(), kRemoveListenerName);
}

void RemoveListener(const ImmutableString& inStationID, const std::weak_ptr<Listener>& inListener) {
  // An expired weak pointer never locks again, so the check may test it anew.
  if (!IsAlive(inListener)) TARN_CONTRACT_CHECK(inListener.lock() != NULL, kRemoveListenerName);
  StationRetainer station(inStationID);
  if (station) station->RemoveListener(inListener);
  else ReportIfUnregistered(inStationID, TARN_CALL_SITE(), kRemoveListenerName);
}

void RemoveListener(const ImmutableString& inStationID, Listener* inListener) {
  TARN_CONTRACT_CHECK(inListener != NULL, kRemoveListenerName);
  RemoveAt(inStationID, inListener, TARN_CALL_SITE());
}

void RemoveListener(const ImmutableString& inStationID, InterfaceRef<ISafeListener> inListener) {
  TARN_CONTRACT_CHECK(inListener != NULL, kRemoveListenerName);
  StationRetainer station(inStationID);
  if (station) station->RemoveListener(inListener);
  else ReportIfUnregistered(inStationID, TARN_CALL_SITE(), kRemoveListenerName);
}

void BroadcastMessage(const ImmutableString& inStationID, const Message& inMessage) {
  BroadcastAt(inStationID, inMessage, TARN_CALL_SITE());
}

void BroadcastPostedCopy(const ImmutableString& inStationID, const Message& inMessage) {
  BroadcastAt(inStationID, inMessage, nullptr);
}

bool HasListeners(const ImmutableString& inStationID) {
  StationRetainer station(inStationID);
  return station && station->HasListeners();
}

void RetainStation(const ImmutableString& inStationID) {
  if (StationRegistry::RetainStation(inStationID) == nullptr)
    ReportIfUnregistered(inStationID, TARN_CALL_SITE(), "Tarn::StationUtils::RetainStation");
}

void ReleaseStation(const ImmutableString& inStationID) { StationRegistry::ReleaseStation(inStationID); }

void StartBroadcasting(const ImmutableString& inStationID) {
  StationRetainer station(inStationID);
  if (station) station->StartBroadcasting();
  else ReportIfUnregistered(inStationID, TARN_CALL_SITE(), "Tarn::StationUtils::StartBroadcasting");
}

void StopBroadcasting(const ImmutableString& inStationID) {
  StationRetainer station(inStationID);
  if (station) station->StopBroadcasting();
  else ReportIfUnregistered(inStationID, TARN_CALL_SITE(), "Tarn::StationUtils::StopBroadcasting");
}

void SwitchStation(const ImmutableString& inFromStationID, const ImmutableString& inToStationID,
                   Listener* inListener) {
  if (inFromStationID.empty()) TARN_CONTRACT_CHECK(!inFromStationID.empty(), kSwitchStationName);
  if (inToStationID.empty()) TARN_CONTRACT_CHECK(!inToStationID.empty(), kSwitchStationName);
  if (inListener == nullptr) {
    TARN_CONTRACT_CHECK(inListener != NULL, kSwitchStationName);
    return;
  }
  // Removal first, so that switching a station to itself re-adds the
  // listener as a newcomer.
  RemoveAt(inFromStationID, inListener, TARN_CALL_SITE());
  AddAt(inToStationID, inListener, TARN_CALL_SITE());
}

void PostMessageToUIThread(const ImmutableString& inStationID, const Message& inMessage, bool inForceAsync) {
  ReportIfUnregistered(inStationID, TARN_CALL_SITE(), "Tarn::StationUtils::PostMessageToUIThread");
  if (!inForceAsync && kivcore::threads::CurrentThreadIsMainThread()) {
    BroadcastMessage(inStationID, inMessage);
    return;
  }
  // The copy is made here, on the posting thread; the queue then holds the
  // only owner of it.
  kivcore::threads::AsyncCallFromMainThread(inMessage.CreateCallback(inStationID), 0);
}

void FlushPostedMessagesOnUIThread() {
  const boost::shared_ptr<kivcore::threads::AsyncEventLoopAdaptor> adaptor =
      kivcore::threads::GetRegisteredMainThread();
  if (!adaptor) return;
  // Anywhere else the posts' broadcasts would be dropped unheard: they stay
  // queued for the main thread.
  const bool onMainThread = kivcore::threads::CurrentThreadIsMainThread();
  TARN_CONTRACT_CHECK(onMainThread, "Tarn::StationUtils::FlushPostedMessagesOnUIThread");
  if (onMainThread) adaptor->RunPendingCalls();
}

}  // namespace StationUtils
}  // namespace Tarn
