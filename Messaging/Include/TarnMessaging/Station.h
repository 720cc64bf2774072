/// @file
/// Tarn::Station: a named relay, both a Broadcaster (listeners attach to it)
/// and a Listener (it can be attached to another broadcaster, and broadcasts
/// again everything it hears).
///
/// @code{.cpp}
///   Tarn::StationUtils::AddListener(Tarn::kStation_StatusBar, &statusLine);
///   Tarn::StationUtils::BroadcastMessage(Tarn::kStation_StatusBar, Progress(1, 2));
/// @endcode
///
/// Stations are normally made, found and deleted by the station registry
/// (StationRegistry.h) and reached by name through StationUtils. A station the
/// registry holds is deleted only by the registry.
///
/// Threading: as Broadcaster and Listener. The destructor first detaches the
/// station's listener part while the station is still whole (off the main
/// thread that waits for a relay through it running on the main thread), then
/// takes the registry's lock for one lookup. The registry detaches a station
/// it deletes before its destructor starts, so a derived station class the
/// registry owns is never reached half-destroyed either; a derived station
/// the host deletes itself on a worker calls DetachFromBroadcasters() first
/// in its own destructor (Listener.h).
///
/// Relay cycles: a station that hears, as a listener, a message object that
/// it is broadcasting already (stations attached to each other in a ring, or
/// a station attached to itself) does not relay it again, which would recurse
/// until the stack overflows. It reports the cycle through the contract-check
/// procedure ("!IsRelaying(inMessage)") and, if the report returns, drops the
/// repeat, so that each listener hears the message once. A handler that
/// broadcasts a new message on the same station is no cycle.
///
/// When a station dies: the registry never deletes a station while a
/// broadcast on it runs on the main thread (its own, or a relay of what it
/// hears). A disposal, last release or Terminate reached from inside such a
/// broadcast retires the station instead, and it is deleted when the
/// outermost of those broadcasts ends. Everywhere else the timing is the
/// registry's (StationRegistry.h).
#pragma once

#include <TarnMessaging/Broadcaster.h>
#include <TarnMessaging/Export.h>
#include <TarnMessaging/Listener.h>

#include <kivcore/ImmutableString.h>

#include <atomic>
#include <cstdint>

namespace Tarn {

/// A named relay: a Broadcaster that listeners attach to, and a Listener
/// that broadcasts again everything it hears. Normally made, found and
/// deleted by the station registry, which owns the stations it holds.
/// Threading as Broadcaster and Listener.
class TARN_MESSAGING_API Station : public Broadcaster, public Listener {
public:
  /// A station named inStationID, with no listeners.
  explicit Station(const kivcore::utility::ImmutableString& inStationID);
  ~Station() override;

  /// Broadcasts to the station's listeners (Broadcaster::BroadcastMessage).
  void BroadcastMessage(const Message& inMessage) override;
  /// Relays a message heard as a listener to the station's own listeners,
  /// straight through Broadcaster::BroadcastMessage, unless this station is
  /// broadcasting that very message object already (a relay cycle).
  /// Precondition: !IsRelaying(inMessage).
  void ListenToMessage(const Message& inMessage) override;

  /// The station's ID, fixed at construction.
  kivcore::utility::ImmutableString GetStationID() const { return mStationID; }

private:
  friend class StationRetirement;
  // Broadcaster::BroadcastMessage, counted in mBroadcastDepth while it runs.
  TARN_MESSAGING_LOCAL void BroadcastCounted(const Message& inMessage);
  // Whether a broadcast of this very object on this station runs below, on
  // the calling thread.
  TARN_MESSAGING_LOCAL bool IsRelaying(const Message& inMessage) const noexcept;

  const kivcore::utility::ImmutableString mStationID;
  // Broadcasts on this station running on the main thread, relays included.
  // Changed only by the thread that broadcasts; read by the registry.
  std::atomic<std::int32_t> mBroadcastDepth{0};
};

}  // namespace Tarn
