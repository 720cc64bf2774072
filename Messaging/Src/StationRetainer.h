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
  // The ID is copied now: by the release the station may be gone (a handler
  // of its broadcast terminated the library), and the release may delete the
  // station and the caller's string with it, so neither is read after the
  // broadcast.
  explicit StationRetainer(const kivcore::utility::ImmutableString& inStationID)
      : mStation(Retain(inStationID, mLife)), mStationID(inStationID) {}
  ~StationRetainer() {
    if (mStation != nullptr) Release(mStationID, &mLife);
  }
  StationRetainer(const StationRetainer&) = delete;
  StationRetainer& operator=(const StationRetainer&) = delete;

  Station* get() const noexcept { return mStation; }
  Station* operator->() const noexcept { return mStation; }
  explicit operator bool() const noexcept { return mStation != nullptr; }

private:
  friend Station* StationRegistry::RetainStation(const kivcore::utility::ImmutableString&);
  friend void StationRegistry::ReleaseStation(const kivcore::utility::ImmutableString&);

  // The registry's retain and release, defined with it. Each Terminate ends
  // one life of the registry. A retain notes the life it was made in, and a
  // release given that life does nothing in a later one: a handler may
  // terminate the library and bring it back, and the ID may then name a new
  // station that this retain never counted. A host's release (no life) is
  // counted on whatever station the ID names.
  static Station* Retain(const kivcore::utility::ImmutableString& inStationID, std::uint64_t& outLife);
  static void Release(const kivcore::utility::ImmutableString& inStationID, const std::uint64_t* inLife);

  std::uint64_t mLife = 0;  // initialised before mStation, which Retain sets it for
  Station* const mStation;
  const kivcore::utility::ImmutableString mStationID;
};

}  // namespace Tarn
