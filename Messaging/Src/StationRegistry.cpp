#include <TarnMessaging/Station.h>
#include <TarnMessaging/StationRegistry.h>

#include <kivcore/Guid.h>
#include <kivcore/MainThread.h>
#include <kivcore/RecursiveMutex.h>
#include <kivcore/SmallBlockAllocator.h>

#include <atomic>
#include <cstdint>
#include <cstdio>
#include <functional>
#include <map>
#include <memory>
#include <new>
#include <utility>
#include <vector>

namespace Tarn {

using kivcore::threads::RecursiveMutex;
using kivcore::utility::ImmutableString;
template <class T>
using Alloc = kivcore::utility::SmallBlockAllocator::STLAllocator<T>;

namespace {

struct StationRecord {
  ImmutableString mStationID;  // the factory is called with this copy
  StationFactory mFactory;     // null for a station handed over as an object
  Station* mStation;           // owned; null until made
  std::uint32_t mRetainCount;
  bool mDisposeRequested;
  // Set while the factory runs. A station whose construction fails is
  // destroyed inside the factory, and its destructor looks its own ID up:
  // that lookup must not call the factory again (it would recurse for ever).
  bool mMaking = false;
};

// Keys compare by identity (interned handles), never by text.
using StationMap = std::map<ImmutableString, StationRecord, std::less<ImmutableString>,
                            Alloc<std::pair<const ImmutableString, StationRecord>>>;
using PendingStationList = std::vector<Station*, Alloc<Station*>>;

// Constant-initialised, with a trivial destructor: usable even by a station
// destroyed after the registry at process exit.
RecursiveMutex sStationRegistryMutex;
std::atomic<std::int32_t> sStationMapAlive{0};

Station* DefaultStationFactory(const ImmutableString& inStationID) { return new Station(inStationID); }

struct StationMapHolder {
  StationMapHolder() { sStationMapAlive.store(1); }
  // The flag drops before the map goes, so late users get a map of their own.
  ~StationMapHolder() { sStationMapAlive.store(0); }
  StationMap mMap;
};

// The registry's map for one operation: the process-wide map while it lives;
// after its static destruction, a fresh empty map owned by the operation and
// reclaimed when it ends.
class StationMapAccess {
public:
  StationMapAccess() {
    static StationMapHolder sHolder;
    if (sStationMapAlive.load() != 0) {
      mMap = &sHolder.mMap;
    } else {
      std::fputs("SERIOUS ERROR!  StationRegistry has already been destructed.\n", stderr);
      mOrphan = std::make_unique<StationMap>();
      mMap = mOrphan.get();
    }
  }
  StationMap& operator*() const noexcept { return *mMap; }
  StationMap* operator->() const noexcept { return mMap; }

private:
  StationMap* mMap = nullptr;
  std::unique_ptr<StationMap> mOrphan;
};

class RegistryLock {
public:
  explicit RegistryLock(const char* inLabel) { sStationRegistryMutex.Lock(inLabel); }
  ~RegistryLock() { sStationRegistryMutex.Unlock(); }
  RegistryLock(const RegistryLock&) = delete;
  RegistryLock& operator=(const RegistryLock&) = delete;
};

void DeleteAll(PendingStationList& ioList) {
  // A station destructor may dispose of another station and re-enter here:
  // take the list's contents out before deleting, so that each station is
  // deleted once and newcomers are picked up by the next round.
  while (!ioList.empty()) {
    PendingStationList batch;
    batch.swap(ioList);
    for (Station* station : batch) delete station;
  }
}

struct PendingStationHolder {
  ~PendingStationHolder() {
    RegistryLock lock(nullptr);
    DeleteAll(mStations);
  }
  PendingStationList mStations;
};

PendingStationList& GetPendingStationList() {
  static PendingStationHolder sHolder;
  return sHolder.mStations;
}

// Finds the record, making its station through the factory if needed. The
// registry's lock must be held; the record keeps its address while the
// factory runs (a map node does not move).
Station* MakeStation(StationRecord& ioRecord) {
  if (ioRecord.mStation == nullptr && ioRecord.mFactory != nullptr && !ioRecord.mMaking) {
    ioRecord.mMaking = true;
    struct MakingReset {
      bool& mFlag;
      ~MakingReset() { mFlag = false; }
    } reset{ioRecord.mMaking};
    ioRecord.mStation = ioRecord.mFactory(ioRecord.mStationID);
  }
  return ioRecord.mStation;
}

}  // namespace

namespace StationRegistry {

void RegisterStation(const ImmutableString& inStationID, StationFactory inFactory) {
  RegistryLock lock("StationRegistry::RegisterStation");
  StationMapAccess map;
  map->try_emplace(inStationID,
                   StationRecord{inStationID, inFactory != nullptr ? inFactory : &DefaultStationFactory, nullptr, 0, false, false});
}

void RegisterStation(Station* inStation) {
  if (inStation == nullptr) return;
  RegistryLock lock("StationRegistry::RegisterStation");
  StationMapAccess map;
  const ImmutableString stationID = inStation->GetStationID();
  map->try_emplace(stationID, StationRecord{stationID, nullptr, inStation, 0, false, false});
}

ImmutableString UniqueStationID() {
  const std::string text = kivcore::utility::Guid::CreateUnique().AsUTF8String();
  return ImmutableString::CreateDynamic(text);
}

ImmutableString RegisterUniqueStation() {
  ImmutableString stationID = UniqueStationID();
  RegisterStation(stationID, nullptr);
  return stationID;
}

Station* FindStation(const ImmutableString& inStationID) {
  RegistryLock lock("StationRegistry::FindStation");
  StationMapAccess map;
  const auto found = map->find(inStationID);
  if (found == map->end()) return nullptr;
  return MakeStation(found->second);
}

Station* RetainStation(const ImmutableString& inStationID) {
  RegistryLock lock("StationRegistry::RetainStation");
  StationMapAccess map;
  const auto found = map->find(inStationID);
  if (found == map->end()) return nullptr;
  // Counted before the station is made, and taken back when no station
  // comes of it (the factory returned null or threw): callers release only
  // the retains that gave them a station, so a count left standing would keep
  // a later disposal from ever deleting the station.
  StationRecord& record = found->second;
  ++record.mRetainCount;
  Station* station = nullptr;
  try {
    station = MakeStation(record);
  } catch (...) {
    --record.mRetainCount;
    throw;
  }
  if (station == nullptr) --record.mRetainCount;
  return station;
}

void ReleaseStation(const ImmutableString& inStationID) {
  Station* doomed = nullptr;
  {
    RegistryLock lock("StationRegistry::ReleaseStation");
    StationMapAccess map;
    const auto found = map->find(inStationID);
    if (found == map->end()) return;
    StationRecord& record = found->second;
    if (record.mStation == nullptr) return;
    --record.mRetainCount;
    if (record.mRetainCount != 0 || !record.mDisposeRequested) return;
    doomed = record.mStation;
    record.mStation = nullptr;
    map->erase(found);
  }
  // Deleted after the lock is released: on a worker thread the station's
  // destructor may wait for the main thread to finish delivering to it, and
  // the main thread's handlers must be able to reach the registry meanwhile.
  // The record is already gone, so nobody else can reach the station.
  delete doomed;
}

void DisposeStation(const ImmutableString& inStationID) {
  RegistryLock lock(nullptr);
  StationMapAccess map;
  const auto found = map->find(inStationID);
  if (found == map->end()) return;
  StationRecord& record = found->second;
  if (record.mRetainCount != 0) {
    record.mDisposeRequested = true;
    return;
  }
  const bool onMainThread = kivcore::threads::CurrentThreadIsMainThread();
  PendingStationList& pending = GetPendingStationList();
  // Room is made before the record goes, so an exhausted allocator cannot
  // leave a station that nobody owns.
  if (!onMainThread && record.mStation != nullptr) pending.reserve(pending.size() + 1);
  Station* station = record.mStation;
  record.mStation = nullptr;
  map->erase(found);
  if (onMainThread) {
    delete station;
    DeleteAll(pending);
  } else if (station != nullptr) {
    pending.push_back(station);
  }
}

void Terminate() {
  StationMap doomed;
  {
    RegistryLock lock("StationRegistry::Terminate");
    StationMapAccess map;
    doomed.swap(*map);
  }
  // Station destructors run without the registry's lock; each looks itself
  // up and finds nothing.
  for (auto& element : doomed) {
    Station* station = element.second.mStation;
    element.second.mStation = nullptr;
    delete station;
  }
}

}  // namespace StationRegistry
}  // namespace Tarn
