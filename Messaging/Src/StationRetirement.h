// Between stations and their registry: a station is never deleted while a
// broadcast on it runs on the deleting thread's stack.
//
// Station counts the broadcasts on it that run on the main thread (its own
// and the relays of what it hears). The registry, about to delete a station
// on the main thread, retires it instead while that count is not 0; retired
// stations are deleted when the outermost of those broadcasts ends, by the
// registry's main-thread disposals and releases, and after Terminate.
// Terminate also retires the stations that running calls hold by ID; the
// last of those calls' releases deletes them.
#pragma once

#include <TarnMessaging/Station.h>

namespace Tarn {

class StationRetirement {
public:
  // Whether a main-thread broadcast on inStation is in progress.
  static bool IsBroadcasting(const Station& inStation) noexcept {
    return inStation.mBroadcastDepth.load(std::memory_order_seq_cst) > 0;
  }
  // Deletes every retired or queued station that no broadcast holds any
  // more. Cheap when there is none. Defined with the registry.
  static void DrainRetired();
  // How the registry deletes a station it owns: detached first, while the
  // whole object (a host's derived station included) still stands, so that
  // a delivery to it on another thread ends before any part is destroyed.
  static void Delete(Station* inStation) noexcept {
    if (inStation == nullptr) return;
    inStation->DetachFromBroadcasters();
    delete inStation;
  }
};

}  // namespace Tarn
