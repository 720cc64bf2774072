#include <TarnMessaging/Station.h>
#include <TarnMessaging/StationRegistry.h>

#include "BroadcasterCore.h"
#include "DiagnosticReports.h"
#include "StationRetainer.h"
#include "StationRetirement.h"

#include <kivcore/Guid.h>
#include <kivcore/MainThread.h>
#include <kivcore/RecursiveMutex.h>
#include <kivcore/SmallBlockAllocator.h>

#include <algorithm>
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
  // The holds of running calls among mRetainCount. While one stands the
  // record stays in the map, whatever a host's unbalanced releases did to
  // the count, so that the call's release can find it by address.
  std::uint32_t mCallHolds = 0;
};

// Keys compare by identity (interned handles), never by text.
using StationMap = std::map<ImmutableString, StationRecord, std::less<ImmutableString>,
                            Alloc<std::pair<const ImmutableString, StationRecord>>>;
// A station the registry no longer lists but still owns. mRetired: kept for
// the end of a broadcast on it, or of the calls that hold it (else: queued
// by a disposal off the main thread, for the next main-thread disposal).
// mClaim: the number of the running deletion sweep that will delete it (0:
// none). mCallHolds: the holds of calls that were running when a
// Terminate took the station from the registry; the last of their releases
// deletes it, and no sweep does before.
struct PendingStation {
  Station* mStation;
  bool mRetired;
  std::uint32_t mClaim = 0;
  std::uint32_t mCallHolds = 0;
};
using PendingStationList = std::vector<PendingStation, Alloc<PendingStation>>;

// Constant-initialised, with a trivial destructor: usable even by a station
// destroyed after the registry at process exit.
RecursiveMutex sStationRegistryMutex;
std::atomic<std::int32_t> sStationMapAlive{0};
// The registry's life: Terminate starts a new one. Guarded by the lock.
std::uint64_t sLife = 0;

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
  bool IsOrphan() const noexcept { return mOrphan != nullptr; }

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

// Set while the pending list holds a retired station, so that the end of
// every station broadcast can tell in one load that there is nothing to do.
std::atomic<bool> sHasRetired{false};

enum class Sweep {
  kRetired,   // stations kept for the end of a broadcast on them
  kAll,       // and those queued by disposals off the main thread
  kEverything // at static destruction: every station, busy or not
};

// After stations left the pending list: whether a retired one remains, and
// no storage once it is empty, so that a drained registry holds no blocks
// beyond its records. The registry's lock must be held.
void Settle(PendingStationList& ioList) noexcept {
  sHasRetired.store(std::any_of(ioList.begin(), ioList.end(), [](const PendingStation& inPending) { return inPending.mRetired; }));
  if (ioList.empty()) PendingStationList().swap(ioList);
}

// Deletes a station the registry no longer reaches, letting the registry's
// lock go (one level of it) meanwhile: the station's detach may wait for a
// delivery to it on another thread (the main thread may have moved), and
// that delivery's end looks for retired stations under the lock. The lock
// must be held.
void DeleteUnlocked(Station* inStation) noexcept {
  const kivcore::threads::ScopedUnlock unlocked(sStationRegistryMutex, nullptr);
  StationRetirement::Delete(inStation);
}

// Deletes the stations of the list that Sweep names and no broadcast holds,
// in the order they were queued; a busy one stays, retired, for the end of
// that broadcast. The registry's lock must be held; it is let go while each
// station is deleted. A station destructor may dispose of another station
// and re-enter here, and another thread may sweep meanwhile: each call
// claims the stations it will delete, under a number no running call has,
// before deleting any, and deletes only its own claims, so none is deleted
// twice and none is lost.
void DeleteAll(PendingStationList& ioList, Sweep inSweep) {
  static std::uint32_t sLastSweep = 0;  // guarded by the registry's lock
  if (++sLastSweep == 0) ++sLastSweep;  // 0 means unclaimed
  const std::uint32_t sweep = sLastSweep;
  for (PendingStation& pending : ioList) {
    if (pending.mClaim != 0 || (inSweep != Sweep::kEverything && pending.mCallHolds != 0)) continue;
    if (inSweep != Sweep::kEverything && StationRetirement::IsBroadcasting(*pending.mStation)) {
      pending.mRetired = true;
    } else if (inSweep != Sweep::kRetired || pending.mRetired) {
      pending.mClaim = sweep;
    }
  }
  for (;;) {
    const auto doomed = std::find_if(ioList.begin(), ioList.end(), [&](const PendingStation& inPending) { return inPending.mClaim == sweep; });
    if (doomed == ioList.end()) break;
    Station* const station = doomed->mStation;
    ioList.erase(doomed);
    DeleteUnlocked(station);
  }
  Settle(ioList);
}

struct PendingStationHolder {
  ~PendingStationHolder() {
    RegistryLock lock(nullptr);
    DeleteAll(mStations, Sweep::kEverything);
  }
  PendingStationList mStations;
};

PendingStationList& GetPendingStationList() {
  static PendingStationHolder sHolder;
  return sHolder.mStations;
}

// Keeps a station that a main-thread broadcast holds for the end of that
// broadcast. Room in the list must have been made. The registry's lock must
// be held.
void Retire(Station* inStation) {
  GetPendingStationList().push_back(PendingStation{inStation, true});
  sHasRetired.store(true);
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

// The release that completes a pending disposal: the record goes, and its
// station is returned, to be deleted once the lock is let go. On the main
// thread, a release from inside a broadcast on the station (its own relay,
// say) must not pull the station from under it: the station is retired
// instead, in room made before anything changes, and null is returned. When
// that room cannot be had, a host's release throws std::bad_alloc with
// nothing changed; a call's own release runs in a destructor and cannot
// fail, so it leaves the station, its disposal pending, for the next
// disposal, release or Terminate to complete. The registry's lock must be
// held.
Station* CompleteDisposal(StationMap& ioMap, StationMap::iterator inFound, bool inCallsOwn) {
  StationRecord& record = inFound->second;
  Station* const doomed = record.mStation;
  PendingStationList& pending = GetPendingStationList();
  if (kivcore::threads::CurrentThreadIsMainThread() && StationRetirement::IsBroadcasting(*doomed)) {
    try {
      pending.reserve(pending.size() + 1);
    } catch (const std::bad_alloc&) {
      if (!inCallsOwn) throw;
      --record.mRetainCount;
      return nullptr;
    }
    ioMap.erase(inFound);
    Retire(doomed);
    return nullptr;
  }
  ioMap.erase(inFound);
  if (pending.empty()) PendingStationList().swap(pending);
  return doomed;
}

// What Terminate finds left over in the registry it takes: stations still
// retained by the host or with listeners still attached, whose users will
// find them gone without a word. Counted under the registry's lock, while
// every station is still there to count; reported after it is let go, since
// the report calls the host's error handler.
struct Leftovers {
  std::size_t mRetained = 0;
  std::size_t mListened = 0;
  ImmutableString mFirstRetained;
  std::size_t mRetainCount = 0;
  ImmutableString mFirstListened;
  std::size_t mListeners = 0;

  void Count(const StationMap& inMap) {
    for (const auto& element : inMap) {
      const StationRecord& record = element.second;
      if (record.mStation == nullptr) continue;
      // The holds of calls still running (a handler's delivery among them)
      // are the library's own, not the host's to balance.
      if (record.mRetainCount > record.mCallHolds && mRetained++ == 0) {
        mFirstRetained = record.mStationID;
        mRetainCount = record.mRetainCount - record.mCallHolds;
      }
      const std::size_t count = BroadcasterCore::CountListeners(*record.mStation);
      if (count != 0 && mListened++ == 0) {
        mFirstListened = record.mStationID;
        mListeners = count;
      }
    }
  }

  void Report(const void* inCallSite) const {
    using Diagnostics::Detail::Failure;
    if (mRetained != 0) {
      Diagnostics::Detail::ReportSilentFailure(Failure::kRetainedAtTerminate, inCallSite, "Tarn::Messaging::Terminate",
                                               mFirstRetained, mRetained, mRetainCount);
    }
    if (mListened != 0) {
      Diagnostics::Detail::ReportSilentFailure(Failure::kListenersAtTerminate, inCallSite, "Tarn::Messaging::Terminate",
                                               mFirstListened, mListened, mListeners);
    }
  }
};

// A call's release of a station that a Terminate retired while the call
// held it: the last such release takes the station from the pending list
// and returns it, to be deleted once the lock is let go, unless a broadcast
// on it still runs (its end deletes it then). The registry's lock must be
// held.
Station* ReleaseRetiredHold(Station* inStation) noexcept {
  PendingStationList& pending = GetPendingStationList();
  const auto held = std::find_if(pending.begin(), pending.end(), [&](const PendingStation& inPending) {
    return inPending.mStation == inStation && inPending.mCallHolds != 0;
  });
  if (held == pending.end() || --held->mCallHolds != 0 || StationRetirement::IsBroadcasting(*inStation)) return nullptr;
  pending.erase(held);
  Settle(pending);
  return inStation;
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

Station* RetainStation(const ImmutableString& inStationID) { return StationRetainer::Retain(inStationID, nullptr); }

void ReleaseStation(const ImmutableString& inStationID) {
  Station* doomed = nullptr;
  {
    RegistryLock lock("StationRegistry::ReleaseStation");
    StationMapAccess map;
    const auto found = map->find(inStationID);
    if (found == map->end()) return;
    StationRecord& record = found->second;
    if (record.mStation == nullptr) return;
    if (record.mRetainCount != 1 || !record.mDisposeRequested || record.mCallHolds != 0) {
      --record.mRetainCount;
      return;
    }
    doomed = CompleteDisposal(*map, found, false);
  }
  // Deleted after the lock is released; see StationRetainer::Release.
  StationRetirement::Delete(doomed);
}

void DisposeStation(const ImmutableString& inStationID) {
  RegistryLock lock(nullptr);
  StationMapAccess map;
  const auto found = map->find(inStationID);
  if (found == map->end()) return;
  StationRecord& record = found->second;
  if (record.mRetainCount != 0 || record.mCallHolds != 0) {
    record.mDisposeRequested = true;
    return;
  }
  const bool onMainThread = kivcore::threads::CurrentThreadIsMainThread();
  Station* const station = record.mStation;
  // Deleted at once on the main thread unless a broadcast on it is in
  // progress there (a handler disposing of the station it hears from).
  const bool deleteNow = station != nullptr && onMainThread && !StationRetirement::IsBroadcasting(*station);
  PendingStationList& pending = GetPendingStationList();
  // Room is made before the record goes, so an exhausted allocator cannot
  // leave a station that nobody owns.
  if (station != nullptr && !deleteNow) pending.reserve(pending.size() + 1);
  record.mStation = nullptr;
  map->erase(found);
  if (deleteNow) {
    DeleteUnlocked(station);
  } else if (station != nullptr && onMainThread) {
    Retire(station);
  } else if (station != nullptr) {
    // Waits for the next main-thread disposal.
    pending.push_back(PendingStation{station, false});
  }
  if (onMainThread) DeleteAll(pending, Sweep::kAll);
}

const char* ToString(StationState inState) noexcept {
  switch (inState) {
    case StationState::kNotMade: return "not made";
    case StationState::kMade: return "made";
    case StationState::kPendingDisposal: return "pending disposal";
    case StationState::kPendingDeletion: return "pending deletion";
  }
  return "unknown";
}

StationSnapshotList Snapshot() {
  StationSnapshotList snapshot;
  RegistryLock lock("StationRegistry::Snapshot");
  StationMapAccess map;
  PendingStationList& pending = GetPendingStationList();
  snapshot.reserve(map->size() + pending.size());
  // Stations are read, never called: a derived station's code does not run
  // under the registry's lock here. Their listener counts take each
  // broadcaster's lock inside the registry's, the order in which a station
  // deleted under the registry's lock takes them too.
  for (const auto& element : *map) {
    const StationRecord& record = element.second;
    StationState state = StationState::kNotMade;
    if (record.mStation != nullptr) state = record.mDisposeRequested ? StationState::kPendingDisposal : StationState::kMade;
    snapshot.push_back(StationSnapshot{record.mStationID, record.mRetainCount, state,
                                       record.mStation != nullptr ? BroadcasterCore::CountListeners(*record.mStation) : 0});
  }
  for (const PendingStation& station : pending) {
    snapshot.push_back(StationSnapshot{station.mStation->GetStationID(), 0, StationState::kPendingDeletion,
                                       BroadcasterCore::CountListeners(*station.mStation)});
  }
  return snapshot;
}

void Terminate() { TerminateFrom(TARN_CALL_SITE()); }

void TerminateFrom(const void* inCallSite) {
  StationMap doomed;
  Leftovers leftovers;
  {
    RegistryLock lock("StationRegistry::Terminate");
    StationMapAccess map;
    // Room for every station, in case each is still in use; made before
    // anything changes, so an exhausted allocator leaves the registry as it
    // was, and used in this same hold, before another thread's disposal or
    // sweep can take it or give it back.
    PendingStationList& pending = GetPendingStationList();
    pending.reserve(pending.size() + map->size());
    if (Diagnostics::Detail::ReportsOn()) leftovers.Count(*map);
    // A station that a running call holds (a worker's StationUtils call, a
    // main-thread broadcast by ID that has not begun yet) or that a broadcast
    // runs on (Terminate called from one of its handlers) is retired: it goes
    // when the last of those calls lets it go, or when that broadcast ends.
    for (auto& element : *map) {
      StationRecord& record = element.second;
      if (record.mStation == nullptr) continue;
      if (record.mCallHolds == 0 && !StationRetirement::IsBroadcasting(*record.mStation)) continue;
      pending.push_back(PendingStation{record.mStation, true, 0, record.mCallHolds});
      sHasRetired.store(true);
      record.mStation = nullptr;
    }
    if (pending.empty()) PendingStationList().swap(pending);
    doomed.swap(*map);
    ++sLife;
  }
  leftovers.Report(inCallSite);
  // Station destructors run without the registry's lock; each looks itself
  // up and finds nothing.
  for (auto& element : doomed) StationRetirement::Delete(std::exchange(element.second.mStation, nullptr));
  // So do the stations workers disposed of, which wait for a main-thread
  // disposal that may never come now; those still in use stay retired.
  RegistryLock lock("StationRegistry::Terminate");
  DeleteAll(GetPendingStationList(), Sweep::kAll);
}

}  // namespace StationRegistry

Station* StationRetainer::Retain(const ImmutableString& inStationID, Hold* outHold) {
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
  if (station == nullptr) {
    --record.mRetainCount;
  } else if (outHold != nullptr) {
    ++record.mCallHolds;
    outHold->mRecord = &record;
    outHold->mLife = sLife;
  }
  return station;
}

void StationRetainer::Release(const Hold& inHold, Station* inStation) noexcept {
  Station* doomed = nullptr;
  {
    RegistryLock lock("StationRegistry::ReleaseStation");
    // After a Terminate the record is gone, and the ID may name a new
    // station that this hold never counted: the hold is on the station that
    // Terminate retired instead.
    if (inHold.mLife != sLife) {
      doomed = ReleaseRetiredHold(inStation);
    } else {
      StationMapAccess map;
      if (map.IsOrphan()) return;
      // The record stands: only this hold's own release removes a record
      // while call holds remain.
      StationRecord& record = *static_cast<StationRecord*>(inHold.mRecord);
      --record.mCallHolds;
      // A count of 0 here is a host's unbalanced release: the disposal this
      // hold deferred is still completed.
      if (record.mRetainCount > 1 || !record.mDisposeRequested || record.mCallHolds != 0) {
        --record.mRetainCount;
        return;
      }
      doomed = CompleteDisposal(*map, map->find(record.mStationID), true);
    }
  }
  // Deleted after the lock is released: on a worker thread the station's
  // destructor waits for a delivery to it running on the main thread, whose
  // handlers must be able to reach the registry meanwhile. Nobody else can
  // reach the station: its record is gone, and it is detached before any part
  // of it (a host's derived station's included) is destroyed, so the main
  // thread never relays through a half-destroyed station.
  StationRetirement::Delete(doomed);
}

bool Diagnostics::Detail::IsStationRegistered(const ImmutableString& inStationID) {
  RegistryLock lock("StationRegistry::IsStationRegistered");
  StationMapAccess map;
  return map->find(inStationID) != map->end();
}

void StationRetirement::DrainRetired() {
  if (!sHasRetired.load()) return;
  RegistryLock lock(nullptr);
  DeleteAll(GetPendingStationList(), Sweep::kRetired);
}

}  // namespace Tarn
