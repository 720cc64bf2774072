/// @file
/// Tarn::StationRegistry: the process-wide registry of stations by ID.
///
/// @code{.cpp}
///   StationRegistry::RegisterStation(myID, nullptr);   // made on first use
///   Station* s = StationRegistry::RetainStation(myID); // counted use
///   ...
///   StationRegistry::ReleaseStation(myID);
///   StationRegistry::DisposeStation(myID);             // deleted when unretained
/// @endcode
///
/// The registry owns every station it holds and is the only party that
/// deletes one. For each ID it keeps a factory or a handed-over station, a
/// retain count and a dispose-requested flag. A retain protects a station
/// against DisposeStation, not against Terminate; a mere FindStation
/// protects it against nothing.
///
/// Snapshot() lists every station with its retain count, state and number of
/// listeners, for a debugger, a log or a leak check at exit.
///
/// Threading: every function may be called from any thread; one recursive
/// lock serialises them. Factories, and the station destructors run by
/// DisposeStation, run with that lock held and may call the registry again on
/// the same thread. DisposeStation deletes only on the main thread; elsewhere
/// it queues the station for the next main-thread disposal (or static
/// destruction). ReleaseStation deletes a station whose disposal is pending on
/// whatever thread makes the last release, after letting go of the lock (the
/// destructor may wait for the main thread, whose handlers may need the
/// registry). Terminate deletes on the calling thread, without the lock.
///
/// A station is never deleted under a broadcast on it: a main-thread
/// disposal, last release or Terminate that meets a station whose broadcast
/// (or relay) is running on the main thread retires it, and it is deleted
/// when that broadcast ends. A queued station met by a main-thread disposal
/// while it relays is retired likewise. Terminate also deletes the retired
/// stations that no broadcast holds any more.
#pragma once

#include <TarnMessaging/Export.h>

#include <kivcore/ImmutableString.h>
#include <kivcore/SmallBlockAllocator.h>

#include <cstddef>
#include <cstdint>
#include <vector>

namespace Tarn {

class Station;

/// Makes a new station for the ID on the heap (the registry owns it), or null.
using StationFactory = Station* (*)(const kivcore::utility::ImmutableString& inStationID);

namespace StationRegistry {

/// Registers inStationID with inFactory (null: a plain Tarn::Station). An ID
/// already registered keeps its record; the new factory is dropped.
TARN_MESSAGING_API void RegisterStation(const kivcore::utility::ImmutableString& inStationID, StationFactory inFactory);
/// Hands inStation to the registry under its own ID. If the ID is already
/// registered nothing changes and the caller keeps the station. Null: no-op.
TARN_MESSAGING_API void RegisterStation(Station* inStation);
/// Registers and returns a new unique ID (a plain station, made on first use).
TARN_MESSAGING_API kivcore::utility::ImmutableString RegisterUniqueStation();
/// A new unique ID; registers nothing.
TARN_MESSAGING_API kivcore::utility::ImmutableString UniqueStationID();
/// The station, made through its factory if needed; null when unregistered.
TARN_MESSAGING_API Station* FindStation(const kivcore::utility::ImmutableString& inStationID);
/// As FindStation, and counts a retain when a station is returned (a factory
/// that yields null or throws leaves the count as it was).
TARN_MESSAGING_API Station* RetainStation(const kivcore::utility::ImmutableString& inStationID);
/// Drops one retain; the last release of a station whose disposal was asked
/// for deletes it. Balance every RetainStation that returned a station.
TARN_MESSAGING_API void ReleaseStation(const kivcore::utility::ImmutableString& inStationID);
/// Removes the ID and deletes its station (see Threading), or, while it is
/// retained, marks it for deletion by the last release.
TARN_MESSAGING_API void DisposeStation(const kivcore::utility::ImmutableString& inStationID);
/// Empties the registry and deletes every station it held, retained or not.
/// With silent-failure reports on (Diagnostics.h), first reports stations
/// still retained or with listeners still attached.
TARN_MESSAGING_API void Terminate();

/// Where a station stands, as Snapshot sees it.
enum class StationState {
  kNotMade,          ///< registered; its factory has not run yet (or gave null)
  kMade,             ///< registered and made
  kPendingDisposal,  ///< disposed of while retained: the last release deletes it
  kPendingDeletion   ///< no longer registered; deleted when a broadcast on it ends
                     ///< or, if queued off the main thread, by the next main-thread disposal
};

/// The state's name for printing: "not made", "made", "pending disposal",
/// "pending deletion"; "unknown" for a value outside the enum.
TARN_MESSAGING_API const char* ToString(StationState inState) noexcept;

/// One station as Snapshot saw it.
struct StationSnapshot {
  kivcore::utility::ImmutableString mStationID;  ///< its ID
  std::uint32_t mRetainCount;                    ///< retains standing (0 once pending deletion)
  StationState mState;                           ///< see StationState
  std::size_t mListenerCount;                    ///< registrations, dead weak ones not yet pruned included
};

/// What Snapshot returns; its storage is small blocks.
using StationSnapshotList =
    std::vector<StationSnapshot, kivcore::utility::SmallBlockAllocator::STLAllocator<StationSnapshot>>;

/// Every station the registry holds: the registered IDs in the registry's
/// order, then the stations waiting for deletion. Taken as one consistent
/// picture under the registry's lock, reading each station's registrations
/// under its broadcaster's lock; no station's or factory's code is called
/// and nothing changes. Throws std::bad_alloc when storage is out.
TARN_MESSAGING_API StationSnapshotList Snapshot();

}  // namespace StationRegistry
}  // namespace Tarn
