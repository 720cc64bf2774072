// StationRetainer: holds a retain on a station reached by ID for one call.
// Used by the station utilities and by registrations on stations.
#pragma once

#include <TarnMessaging/Station.h>
#include <TarnMessaging/StationRegistry.h>

#include <kivcore/ImmutableString.h>

#include <cstdint>

namespace Tarn {

// Retains a station for one call and releases it on every way out.
class StationRetainer {
public:
  explicit StationRetainer(const kivcore::utility::ImmutableString& inStationID)
      : mStation(Retain(inStationID, &mHold)) {}
  ~StationRetainer() {
    if (mStation != nullptr) Release(mHold, mStation);
  }
  StationRetainer(const StationRetainer&) = delete;
  StationRetainer& operator=(const StationRetainer&) = delete;

  Station* get() const noexcept { return mStation; }
  Station* operator->() const noexcept { return mStation; }
  explicit operator bool() const noexcept { return mStation != nullptr; }

private:
  friend Station* StationRegistry::RetainStation(const kivcore::utility::ImmutableString&);

  // What a call's retain needs for its release: the registry record it
  // counted on, and the registry's life it was made in. Each Terminate ends
  // one life, and retires the stations that calls still hold instead of
  // deleting them; a release in a later life never touches the ID's record
  // (a handler may terminate the library and bring it back, and the ID may
  // then name a new station that this retain never counted), but lets the
  // retired station go, deleting it when it was the last call to hold it.
  // The release neither looks the ID up nor reads the caller's string, which
  // the release may delete with the station.
  struct Hold {
    void* mRecord = nullptr;
    std::uint64_t mLife = 0;
  };

  // The registry's retain and a call's release, defined with it. A retain
  // with a hold is a call's: its record keeps its place in the registry until
  // the release. Without one it is a host's RetainStation.
  static Station* Retain(const kivcore::utility::ImmutableString& inStationID, Hold* outHold);
  static void Release(const Hold& inHold, Station* inStation) noexcept;

  Hold mHold;  // initialised before mStation, which Retain fills it for
  Station* const mStation;
};

}  // namespace Tarn
