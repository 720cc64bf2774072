#include <TarnMessaging/Broadcaster.h>
#include <TarnMessaging/Listener.h>
#include <TarnMessaging/Station.h>
#include <TarnMessaging/StationRegistry.h>
#include <TarnMessaging/StationUtils.h>

#include "ContractCheck.h"
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

}  // namespace

void AddListener(const ImmutableString& inStationID, const boost::weak_ptr<Listener>& inListener) {
  StationRetainer station(inStationID);
  if (station) station->AddListener(inListener);
}

void AddListener(const ImmutableString& inStationID, const std::weak_ptr<Listener>& inListener) {
  StationRetainer station(inStationID);
  if (station) station->AddListener(inListener);
}

void AddListener(const ImmutableString& inStationID, Listener* inListener) {
  StationRetainer station(inStationID);
  if (station) station->AddListener(inListener);
}

void AddListener(const ImmutableString& inStationID, InterfaceRef<ISafeListener> inListener) {
  StationRetainer station(inStationID);
  if (station) station->AddListener(inListener);
}

void RemoveListener(const ImmutableString& inStationID, const boost::weak_ptr<Listener>& inListener) {
  // An expired weak pointer never locks again, so the check may test it anew.
  if (!IsAlive(inListener)) TARN_CONTRACT_CHECK(inListener.lock() != NULL, kRemoveListenerName);
  StationRetainer station(inStationID);
  if (station) station->RemoveListener(inListener);
}

void RemoveListener(const ImmutableString& inStationID, const std::weak_ptr<Listener>& inListener) {
  // An expired weak pointer never locks again, so the check may test it anew.
  if (!IsAlive(inListener)) TARN_CONTRACT_CHECK(inListener.lock() != NULL, kRemoveListenerName);
  StationRetainer station(inStationID);
  if (station) station->RemoveListener(inListener);
}

void RemoveListener(const ImmutableString& inStationID, Listener* inListener) {
  TARN_CONTRACT_CHECK(inListener != NULL, kRemoveListenerName);
  StationRetainer station(inStationID);
  // The broadcaster checks and ignores a null listener itself.
  if (station) station->RemoveListener(inListener, true);
}

void RemoveListener(const ImmutableString& inStationID, InterfaceRef<ISafeListener> inListener) {
  TARN_CONTRACT_CHECK(inListener != NULL, kRemoveListenerName);
  StationRetainer station(inStationID);
  if (station) station->RemoveListener(inListener);
}

void BroadcastMessage(const ImmutableString& inStationID, const Message& inMessage) {
  StationRetainer station(inStationID);
  if (station) station->BroadcastMessage(inMessage);
}

bool HasListeners(const ImmutableString& inStationID) {
  StationRetainer station(inStationID);
  return station && station->HasListeners();
}

void RetainStation(const ImmutableString& inStationID) { StationRegistry::RetainStation(inStationID); }

void ReleaseStation(const ImmutableString& inStationID) { StationRegistry::ReleaseStation(inStationID); }

void StartBroadcasting(const ImmutableString& inStationID) {
  StationRetainer station(inStationID);
  if (station) station->StartBroadcasting();
}

void StopBroadcasting(const ImmutableString& inStationID) {
  StationRetainer station(inStationID);
  if (station) station->StopBroadcasting();
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
  RemoveListener(inFromStationID, inListener);
  AddListener(inToStationID, inListener);
}

void PostMessageToUIThread(const ImmutableString& inStationID, const Message& inMessage, bool inForceAsync) {
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
  if (adaptor) adaptor->RunPendingCalls();
}

}  // namespace StationUtils
}  // namespace Tarn
