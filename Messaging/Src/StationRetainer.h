// StationRetainer: holds a retain on a station reached by ID for one call.
// Used by the station utilities and by registrations on stations.
#pragma once

#include <TarnMessaging/Station.h>
#include <TarnMessaging/StationRegistry.h>

#include <kivcore/ImmutableString.h>

namespace Tarn {

// Retains a station for one call and releases it on every way out.
class StationRetainer {
public:
  // The ID is copied now: by the release the station may be gone (a handler
  // of its broadcast terminated the library), and the release may delete the
  // station and the caller's string with it, so neither is read after the
  // broadcast.
  explicit StationRetainer(const kivcore::utility::ImmutableString& inStationID)
      : mStation(StationRegistry::RetainStation(inStationID)), mStationID(inStationID) {}
  ~StationRetainer() {
    if (mStation != nullptr) StationRegistry::ReleaseStation(mStationID);
  }
  StationRetainer(const StationRetainer&) = delete;
  StationRetainer& operator=(const StationRetainer&) = delete;

  Station* get() const noexcept { return mStation; }
  Station* operator->() const noexcept { return mStation; }
  explicit operator bool() const noexcept { return mStation != nullptr; }

private:
  Station* const mStation;
  const kivcore::utility::ImmutableString mStationID;
};

}  // namespace Tarn
