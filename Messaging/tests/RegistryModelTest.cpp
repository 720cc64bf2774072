// The station registry and the station utilities against a reference model,
// over many short random sequences.
//
// The model keeps, for each station ID of a small pool, the record the
// registry should hold (how its station is made, the station if made, the
// retain count, the dispose flag), the stations queued by disposals made off
// the main thread, the listeners attached to each station and whether it
// broadcasts. Each step applies one random operation to the library and to
// the model, on the main thread or on a helper thread that runs one
// operation at a time (so the sequence stays deterministic), and then
// compares: every station construction and destruction and every listener
// call, in order; the set of stations alive; and each live station's
// listeners and broadcasting state.
//
// Stations made by the model's factories log their lives; some of them, when
// destroyed, dispose of a partner station (re-entering the registry from a
// station destructor, which is also how the pending list is re-entered).
// One kind of listener disposes of a station from its handler, during a
// broadcast that holds a retain on the station it hears.
#include "ModelTestSupport.h"

#include <TarnMessaging.h>

#include <kivcore/kivcore.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <sstream>
#include <string>
#include <vector>

namespace {

using kivcore::utility::ImmutableString;
using kivcore::utility::SmallBlockAllocator;
using messaging_test::Random;
using messaging_test::SequentialExecutor;
namespace Registry = Tarn::StationRegistry;
namespace Utils = Tarn::StationUtils;

struct Ping : Tarn::MessageImpl<Ping> {};

// ---------------------------------------------------------------------------
// What the library does, as the test sees it

class TrackedStation;

// The record of what happened in the library, in order: "C<serial>:<id>"
// when a tracked station is made, "D<serial>" when it is destroyed,
// "L<number>" when a listener is called. Stations may be made and destroyed
// on the helper thread, so the ledger is locked.
class Ledger {
public:
  static Ledger& Get() {
    static Ledger sLedger;
    return sLedger;
  }

  void Reset() {
    std::lock_guard<std::mutex> lock(mMutex);
    mEvents.clear();
    mLive.clear();
    mLabels.clear();
    mPartners.clear();
    mNextSerial = 1;
  }
  void SetLabel(const ImmutableString& inStationID, std::string inLabel, const ImmutableString& inPartner) {
    std::lock_guard<std::mutex> lock(mMutex);
    mLabels[inStationID] = std::move(inLabel);
    mPartners[inStationID] = inPartner;
  }
  ImmutableString PartnerOf(const ImmutableString& inStationID) {
    std::lock_guard<std::mutex> lock(mMutex);
    const auto found = mPartners.find(inStationID);
    return found != mPartners.end() ? found->second : ImmutableString();
  }

  int NoteConstruction(TrackedStation* inStation, const ImmutableString& inStationID) {
    std::lock_guard<std::mutex> lock(mMutex);
    const int serial = mNextSerial++;
    const auto label = mLabels.find(inStationID);
    mEvents.push_back("C" + std::to_string(serial) + ":" + (label != mLabels.end() ? label->second : "?"));
    mLive[serial] = inStation;
    return serial;
  }
  void NoteDestruction(int inSerial) {
    std::lock_guard<std::mutex> lock(mMutex);
    mEvents.push_back("D" + std::to_string(inSerial));
    mLive.erase(inSerial);
  }
  void NoteCall(int inListener) {
    std::lock_guard<std::mutex> lock(mMutex);
    mEvents.push_back("L" + std::to_string(inListener));
  }

  std::vector<std::string> Events() const {
    std::lock_guard<std::mutex> lock(mMutex);
    return mEvents;
  }
  std::map<int, TrackedStation*> Live() const {
    std::lock_guard<std::mutex> lock(mMutex);
    return mLive;
  }

private:
  mutable std::mutex mMutex;
  std::vector<std::string> mEvents;               // guarded by mMutex
  std::map<int, TrackedStation*> mLive;           // guarded by mMutex; by serial
  std::map<ImmutableString, std::string> mLabels;  // guarded by mMutex
  std::map<ImmutableString, ImmutableString> mPartners;  // guarded by mMutex
  int mNextSerial = 1;                            // guarded by mMutex
};

// A station that logs its life. A chained one disposes of its partner
// station at the start of its destructor.
class TrackedStation : public Tarn::Station {
public:
  TrackedStation(const ImmutableString& inStationID, bool inChained)
      : Tarn::Station(inStationID),
        mPartner(inChained ? Ledger::Get().PartnerOf(inStationID) : ImmutableString()),
        mSerial(Ledger::Get().NoteConstruction(this, inStationID)) {}
  ~TrackedStation() override {
    if (!mPartner.empty()) Registry::DisposeStation(mPartner);
    Ledger::Get().NoteDestruction(mSerial);
  }

private:
  const ImmutableString mPartner;
  const int mSerial;
};

Tarn::Station* CountingFactory(const ImmutableString& inStationID) { return new TrackedStation(inStationID, false); }
Tarn::Station* ChainedFactory(const ImmutableString& inStationID) { return new TrackedStation(inStationID, true); }
Tarn::Station* NullFactory(const ImmutableString&) { return nullptr; }

// A listener that logs its calls; a disposer also disposes of its target
// station from its handler.
class ModelListener : public Tarn::Listener {
public:
  ModelListener(int inNumber, ImmutableString inDisposeTarget)
      : mNumber(inNumber), mDisposeTarget(std::move(inDisposeTarget)) {}
  void ListenToMessage(const Tarn::Message&) override {
    Ledger::Get().NoteCall(mNumber);
    if (!mDisposeTarget.empty()) Registry::DisposeStation(mDisposeTarget);
  }

private:
  const int mNumber;
  const ImmutableString mDisposeTarget;
};

// ---------------------------------------------------------------------------
// The model

// How a record's station is made.
enum class Maker { kCounting, kChained, kNull, kDefault, kObject };

struct ModelStation {
  int mSerial = 0;  // the ledger's serial; 0 for a plain station made by the default factory
  int mID = 0;      // index of its ID in the pool
  bool mChained = false;
  std::vector<int> mListeners;  // listener numbers, newest first
  bool mBroadcasting = true;
  Tarn::Station* mPointer = nullptr;  // plain stations: learnt when a find or retain returns it
};
using StationRef = std::shared_ptr<ModelStation>;

struct ModelRecord {
  Maker mMaker = Maker::kDefault;
  StationRef mStation;  // null until made
  std::uint32_t mRetains = 0;
  bool mDisposeRequested = false;
  std::uint32_t mReleasable = 0;  // retains the test took that returned a station
};

struct ModelListenerSlot {
  int mNumber = 0;
  int mDisposeTarget = -1;  // pool index, or -1 for a listener that only logs
};

constexpr int kFixedIDs = 4;
constexpr int kMaxIDs = 8;
constexpr int kListenerSlots = 3;

class RegistryModel {
public:
  explicit RegistryModel(std::vector<ImmutableString>* inIDs) : mIDs(inIDs) {}

  // --- registry operations; inMain: whether the calling thread is the main thread

  void Register(int inID, Maker inMaker) {
    if (mRecords.count(inID) != 0) return;
    ModelRecord record;
    record.mMaker = inMaker;
    mRecords.emplace(inID, record);
  }
  // A station handed over as an object: true when the registry took it.
  bool RegisterObject(int inID, const StationRef& inStation) {
    if (mRecords.count(inID) != 0) return false;
    ModelRecord record;
    record.mMaker = Maker::kObject;
    record.mStation = inStation;
    mRecords.emplace(inID, record);
    return true;
  }
  StationRef NewTracked(int inID, bool inChained) {
    auto station = std::make_shared<ModelStation>();
    station->mSerial = mNextSerial++;
    station->mID = inID;
    station->mChained = inChained;
    mEvents.push_back("C" + std::to_string(station->mSerial) + ":" + Label(inID));
    mLive[station->mSerial] = station;
    return station;
  }
  StationRef Find(int inID, bool inMain) {
    const auto found = mRecords.find(inID);
    if (found == mRecords.end()) return nullptr;
    return Make(found->second, inID, inMain);
  }
  // A retain that yields no station (a factory that makes none) is not
  // counted: its caller has nothing to release.
  StationRef Retain(int inID, bool inMain) {
    const auto found = mRecords.find(inID);
    if (found == mRecords.end()) return nullptr;
    ++found->second.mRetains;
    StationRef station = Make(found->second, inID, inMain);
    if (!station) --found->second.mRetains;
    return station;
  }
  void Release(int inID, bool inMain) {
    const auto found = mRecords.find(inID);
    if (found == mRecords.end() || !found->second.mStation) return;
    ModelRecord& record = found->second;
    --record.mRetains;
    if (record.mRetains != 0 || !record.mDisposeRequested) return;
    StationRef doomed = record.mStation;
    mRecords.erase(found);
    Destroy(doomed, inMain);
  }
  void Dispose(int inID, bool inMain) {
    const auto found = mRecords.find(inID);
    if (found == mRecords.end()) return;
    if (found->second.mRetains != 0) {
      found->second.mDisposeRequested = true;
      return;
    }
    StationRef station = found->second.mStation;
    mRecords.erase(found);
    if (inMain) {
      if (station) Destroy(station, true);
      DeleteAll(true);
    } else if (station) {
      mPending.push_back(station);
    }
  }
  // Stations go in the registry's key order, which is the order of the IDs'
  // handles, not of their texts.
  void Terminate(bool inMain) {
    std::vector<std::pair<ImmutableString, StationRef>> doomed;
    for (auto& element : mRecords) doomed.emplace_back((*mIDs)[element.first], element.second.mStation);
    mRecords.clear();
    std::sort(doomed.begin(), doomed.end(),
              [](const auto& inA, const auto& inB) { return inA.first < inB.first; });
    for (auto& element : doomed)
      if (element.second) Destroy(element.second, inMain);
  }
  void DeleteAll(bool inMain) {
    while (!mPending.empty()) {
      std::vector<StationRef> batch;
      batch.swap(mPending);
      for (StationRef& station : batch) Destroy(station, inMain);
    }
  }
  // A station given to RegisterObject and refused: its owner deletes it.
  void DestroyRefused(const StationRef& inStation, bool inMain) { Destroy(inStation, inMain); }

  // --- station utilities

  // Retains the station for one call, applies inOperation to it (when there
  // is one) and releases it; false when there was no station.
  template <class Operation>
  bool WithStation(int inID, bool inMain, Operation inOperation) {
    const StationRef station = Retain(inID, inMain);
    if (!station) return false;
    inOperation(*station);
    Release(inID, inMain);
    return true;
  }
  void AddListener(int inID, int inListener, bool inMain) {
    WithStation(inID, inMain, [&](ModelStation& inStation) {
      auto& listeners = inStation.mListeners;
      if (std::find(listeners.begin(), listeners.end(), inListener) == listeners.end())
        listeners.insert(listeners.begin(), inListener);
    });
  }
  void RemoveListener(int inID, int inListener, bool inMain) {
    WithStation(inID, inMain, [&](ModelStation& inStation) { Erase(inStation.mListeners, inListener); });
  }
  bool HasListeners(int inID, bool inMain) {
    bool result = false;
    WithStation(inID, inMain, [&](ModelStation& inStation) { result = !inStation.mListeners.empty(); });
    return result;
  }
  void SetBroadcasting(int inID, bool inOn, bool inMain) {
    WithStation(inID, inMain, [&](ModelStation& inStation) { inStation.mBroadcasting = inOn; });
  }
  void Broadcast(int inID, bool inMain) {
    WithStation(inID, inMain, [&](ModelStation& inStation) {
      if (!inMain || !inStation.mBroadcasting) return;
      // Handlers here only log and dispose of stations, which never changes
      // this station's listeners: the broadcast serves the list as it is.
      const std::vector<int> listeners = inStation.mListeners;
      for (int number : listeners) {
        mEvents.push_back("L" + std::to_string(number));
        const ModelListenerSlot* slot = SlotOf(number);
        if (slot != nullptr && slot->mDisposeTarget >= 0) Dispose(slot->mDisposeTarget, true);
      }
    });
  }
  void Switch(int inFrom, int inTo, int inListener, bool inMain) {
    RemoveListener(inFrom, inListener, inMain);
    AddListener(inTo, inListener, inMain);
  }
  // A retain that stands between calls; counted as releasable when it
  // reached a station.
  void UtilsRetain(int inID, bool inMain) {
    if (Retain(inID, inMain)) AddReleasable(inID);
  }
  void AddReleasable(int inID) { ++mRecords.at(inID).mReleasable; }
  // Releases one of the retains the test took.
  void ReleaseRetained(int inID, bool inMain) {
    --mRecords.at(inID).mReleasable;
    Release(inID, inMain);
  }
  std::uint32_t Releasable(int inID) const {
    const auto found = mRecords.find(inID);
    return found != mRecords.end() ? found->second.mReleasable : 0;
  }

  // --- listeners

  ModelListenerSlot& Slot(int inSlot) { return mSlots[inSlot]; }
  // A listener destroyed: every station it was attached to drops it.
  void DestroyListener(int inSlot) {
    const int number = mSlots[inSlot].mNumber;
    for (auto& element : mRecords)
      if (element.second.mStation) Erase(element.second.mStation->mListeners, number);
    for (StationRef& station : mPending) Erase(station->mListeners, number);
  }

  // --- what the comparison reads

  const std::vector<std::string>& Events() const { return mEvents; }
  const std::map<int, StationRef>& LiveTracked() const { return mLive; }
  // Every station alive: those the registry holds and those queued.
  std::vector<StationRef> LiveStations() const {
    std::vector<StationRef> stations;
    for (const auto& element : mRecords)
      if (element.second.mStation) stations.push_back(element.second.mStation);
    for (const StationRef& station : mPending) stations.push_back(station);
    return stations;
  }
  bool Registered(int inID) const { return mRecords.count(inID) != 0; }
  std::string Label(int inID) const { return std::string(1, static_cast<char>('A' + inID)); }

private:
  StationRef Make(ModelRecord& ioRecord, int inID, bool) {
    if (ioRecord.mStation) return ioRecord.mStation;
    switch (ioRecord.mMaker) {
      case Maker::kCounting:
        ioRecord.mStation = NewTracked(inID, false);
        break;
      case Maker::kChained:
        ioRecord.mStation = NewTracked(inID, true);
        break;
      case Maker::kDefault:
        ioRecord.mStation = std::make_shared<ModelStation>();
        ioRecord.mStation->mID = inID;
        break;
      case Maker::kNull:
      case Maker::kObject:
        break;
    }
    return ioRecord.mStation;
  }

  // A station's destructor: a chained one disposes of its partner first;
  // then the station logs its end; then the base class looks its own ID up,
  // which makes the station of a record registered anew under that ID.
  void Destroy(const StationRef& inStation, bool inMain) {
    if (inStation->mChained) Dispose(PartnerIndex(inStation->mID), inMain);
    if (inStation->mSerial != 0) {
      mEvents.push_back("D" + std::to_string(inStation->mSerial));
      mLive.erase(inStation->mSerial);
    }
    Find(inStation->mID, inMain);
  }

  static int PartnerIndex(int inID) { return inID < kFixedIDs ? (inID + 1) % kFixedIDs : 0; }
  static void Erase(std::vector<int>& ioList, int inValue) {
    ioList.erase(std::remove(ioList.begin(), ioList.end(), inValue), ioList.end());
  }
  const ModelListenerSlot* SlotOf(int inNumber) const {
    for (const ModelListenerSlot& slot : mSlots)
      if (slot.mNumber == inNumber) return &slot;
    return nullptr;
  }

  std::vector<ImmutableString>* mIDs;
  std::map<int, ModelRecord> mRecords;
  std::vector<StationRef> mPending;
  std::vector<std::string> mEvents;
  std::map<int, StationRef> mLive;  // tracked stations alive, by serial
  ModelListenerSlot mSlots[kListenerSlots];
  int mNextSerial = 1;
};

// ---------------------------------------------------------------------------
// One random sequence

class Sequence {
public:
  Sequence(std::uint64_t inSeed, SequentialExecutor& inHelper)
      : mRandom(inSeed), mHelper(inHelper), mModel(&mIDs) {
    Ledger::Get().Reset();
    for (int i = 0; i < kFixedIDs; ++i) mIDs.push_back(Registry::UniqueStationID());
    for (int i = 0; i < kFixedIDs; ++i) Ledger::Get().SetLabel(mIDs[i], mModel.Label(i), mIDs[(i + 1) % kFixedIDs]);
    for (int slot = 0; slot < kListenerSlots; ++slot) NewListener(slot);
  }

  // Runs inSteps random steps, comparing after each; stops at the first
  // difference.
  void Run(int inSteps) {
    for (int step = 0; step < inSteps && !::testing::Test::HasFailure(); ++step) {
      mOnMain = !mRandom.Percent(20);
      const std::string description = Step();
      SCOPED_TRACE("step " + std::to_string(step) + ": " + description + (mOnMain ? " on the main thread" : " on the helper thread"));
      Compare();
    }
  }

  // Ends everything the sequence made and checks that nothing is left.
  void Finish() {
    SCOPED_TRACE("finishing the sequence");
    mOnMain = true;
    Registry::Terminate();
    mModel.Terminate(true);
    // A main-thread disposal of a registered ID deletes the stations queued
    // by disposals on the helper thread.
    const ImmutableString drain = Registry::UniqueStationID();
    Registry::RegisterStation(drain, nullptr);
    Registry::DisposeStation(drain);
    mModel.DeleteAll(true);
    Compare();
    for (int slot = 0; slot < kListenerSlots; ++slot) mListeners[slot].reset();
    EXPECT_TRUE(Ledger::Get().Live().empty()) << "stations outlived the registry's Terminate and the pending list";
  }

private:
  int AnyID() { return static_cast<int>(mRandom.Below(static_cast<std::uint32_t>(mIDs.size()))); }
  int AnySlot() { return static_cast<int>(mRandom.Below(kListenerSlots)); }
  std::string Name(int inID) const { return mModel.Label(inID); }

  // Runs inOperation on the thread this step uses.
  template <class Operation>
  void OnThread(Operation inOperation) {
    if (mOnMain) {
      inOperation();
    } else {
      mHelper.Run(inOperation);
    }
  }

  void NewListener(int inSlot) {
    ModelListenerSlot& slot = mModel.Slot(inSlot);
    slot.mNumber = mNextListener++;
    slot.mDisposeTarget = mRandom.Percent(30) ? static_cast<int>(mRandom.Below(kFixedIDs)) : -1;
    mListeners[inSlot] = std::make_unique<ModelListener>(
        slot.mNumber, slot.mDisposeTarget >= 0 ? mIDs[slot.mDisposeTarget] : ImmutableString());
  }

  // Checks what a find or retain returned against the model's station.
  void ExpectStation(Tarn::Station* inActual, const StationRef& inExpected, int inID) {
    if (!inExpected) {
      EXPECT_EQ(inActual, nullptr) << "expected no station for " << Name(inID);
      return;
    }
    ASSERT_NE(inActual, nullptr) << "expected a station for " << Name(inID);
    EXPECT_EQ(inActual->GetStationID(), mIDs[inID]);
    if (inExpected->mSerial != 0) {
      const auto live = Ledger::Get().Live();
      const auto found = live.find(inExpected->mSerial);
      ASSERT_NE(found, live.end()) << "station " << inExpected->mSerial << " is not alive";
      EXPECT_EQ(static_cast<Tarn::Station*>(found->second), inActual) << "a different station for " << Name(inID);
    } else if (inExpected->mPointer != nullptr) {
      EXPECT_EQ(inExpected->mPointer, inActual) << "a different plain station for " << Name(inID);
    } else {
      EXPECT_EQ(dynamic_cast<TrackedStation*>(inActual), nullptr) << "the default factory made a tracked station";
      inExpected->mPointer = inActual;
    }
  }

  // One random operation on the library and on the model; returns what it
  // did.
  std::string Step() {
    static const std::uint32_t kWeights[] = {
        6,  // 0 register with a factory
        3,  // 1 register an object
        2,  // 2 register a unique station
        6,  // 3 find
        6,  // 4 retain
        6,  // 5 release
        7,  // 6 dispose
        1,  // 7 terminate
        8,  // 8 utils: add listener
        4,  // 9 utils: remove listener
        3,  // 10 utils: has listeners
        8,  // 11 utils: broadcast
        3,  // 12 utils: start or stop broadcasting
        3,  // 13 utils: switch station
        3,  // 14 utils: retain
        3,  // 15 utils: release
        2,  // 16 destroy a listener and make a new one
        1,  // 17 a unique ID registers nothing
    };
    const bool main = mOnMain;
    switch (mRandom.Weighted(kWeights)) {
      case 0: {
        const int id = AnyID();
        static const Maker kMakers[] = {Maker::kCounting, Maker::kChained, Maker::kNull, Maker::kDefault};
        static const char* const kMakerNames[] = {"counting", "chained", "null", "default"};
        const std::size_t which = mRandom.Below(4);
        static const Tarn::StationFactory kFactories[] = {&CountingFactory, &ChainedFactory, &NullFactory, nullptr};
        OnThread([&] { Registry::RegisterStation(mIDs[id], kFactories[which]); });
        mModel.Register(id, kMakers[which]);
        return std::string("RegisterStation(") + Name(id) + ", " + kMakerNames[which] + ")";
      }
      case 1: {
        const int id = AnyID();
        const bool chained = mRandom.Percent(30);
        TrackedStation* made = nullptr;
        OnThread([&] {
          made = new TrackedStation(mIDs[id], chained);
          Registry::RegisterStation(made);
        });
        const StationRef station = mModel.NewTracked(id, chained);
        if (!mModel.RegisterObject(id, station)) {
          // Refused: the station is still ours. Deleting one the registry
          // took would leave it a dangling pointer, so ask first (which may
          // make the registered station, in the model too).
          Tarn::Station* registered = nullptr;
          OnThread([&] { registered = Registry::FindStation(mIDs[id]); });
          ExpectStation(registered, mModel.Find(id, main), id);
          if (registered == made) {
            ADD_FAILURE() << "the registry took a station for an ID it already had";
            return "RegisterStation(new station " + Name(id) + ")";
          }
          OnThread([&] { delete made; });
          mModel.DestroyRefused(station, main);
        }
        return "RegisterStation(new station " + Name(id) + ")";
      }
      case 2: {
        if (mIDs.size() >= static_cast<std::size_t>(kMaxIDs)) return "RegisterUniqueStation skipped (pool full)";
        ImmutableString id;
        OnThread([&] { id = Registry::RegisterUniqueStation(); });
        for (const ImmutableString& known : mIDs) EXPECT_NE(known, id) << "a unique ID came twice";
        mIDs.push_back(id);
        const int index = static_cast<int>(mIDs.size()) - 1;
        Ledger::Get().SetLabel(id, mModel.Label(index), mIDs[0]);
        mModel.Register(index, Maker::kDefault);
        return "RegisterUniqueStation() -> " + Name(index);
      }
      case 3: {
        const int id = AnyID();
        Tarn::Station* found = nullptr;
        OnThread([&] { found = Registry::FindStation(mIDs[id]); });
        ExpectStation(found, mModel.Find(id, main), id);
        return "FindStation(" + Name(id) + ")";
      }
      case 4: {
        const int id = AnyID();
        Tarn::Station* retained = nullptr;
        OnThread([&] { retained = Registry::RetainStation(mIDs[id]); });
        const StationRef expected = mModel.Retain(id, main);
        ExpectStation(retained, expected, id);
        if (expected) mModel.AddReleasable(id);
        return "RetainStation(" + Name(id) + ")";
      }
      case 5:
      case 15: {
        // Only what was retained is released: unbalanced releases are
        // outside the registry's contract.
        const int id = AnyID();
        if (mModel.Releasable(id) == 0) return "release skipped (nothing retained)";
        const bool throughUtils = mRandom.Percent(50);
        OnThread([&] {
          if (throughUtils) Utils::ReleaseStation(mIDs[id]);
          else Registry::ReleaseStation(mIDs[id]);
        });
        mModel.ReleaseRetained(id, main);
        return std::string(throughUtils ? "StationUtils::" : "StationRegistry::") + "ReleaseStation(" + Name(id) + ")";
      }
      case 6: {
        const int id = AnyID();
        OnThread([&] { Registry::DisposeStation(mIDs[id]); });
        mModel.Dispose(id, main);
        return "DisposeStation(" + Name(id) + ")";
      }
      case 7: {
        OnThread([&] { Registry::Terminate(); });
        mModel.Terminate(main);
        return "Terminate()";
      }
      case 8: {
        const int id = AnyID();
        const int slot = AnySlot();
        OnThread([&] { Utils::AddListener(mIDs[id], mListeners[slot].get()); });
        mModel.AddListener(id, mModel.Slot(slot).mNumber, main);
        return "AddListener(" + Name(id) + ", L" + std::to_string(mModel.Slot(slot).mNumber) + ")";
      }
      case 9: {
        const int id = AnyID();
        const int slot = AnySlot();
        OnThread([&] { Utils::RemoveListener(mIDs[id], mListeners[slot].get()); });
        mModel.RemoveListener(id, mModel.Slot(slot).mNumber, main);
        return "RemoveListener(" + Name(id) + ", L" + std::to_string(mModel.Slot(slot).mNumber) + ")";
      }
      case 10: {
        const int id = AnyID();
        bool has = false;
        OnThread([&] { has = Utils::HasListeners(mIDs[id]); });
        EXPECT_EQ(mModel.HasListeners(id, main), has) << "HasListeners(" << Name(id) << ")";
        return "HasListeners(" + Name(id) + ")";
      }
      case 11: {
        const int id = AnyID();
        OnThread([&] { Utils::BroadcastMessage(mIDs[id], Ping()); });
        mModel.Broadcast(id, main);
        return "BroadcastMessage(" + Name(id) + ")";
      }
      case 12: {
        const int id = AnyID();
        const bool on = mRandom.Percent(50);
        OnThread([&] {
          if (on) Utils::StartBroadcasting(mIDs[id]);
          else Utils::StopBroadcasting(mIDs[id]);
        });
        mModel.SetBroadcasting(id, on, main);
        return std::string(on ? "StartBroadcasting(" : "StopBroadcasting(") + Name(id) + ")";
      }
      case 13: {
        const int from = AnyID();
        const int to = AnyID();
        const int slot = AnySlot();
        OnThread([&] { Utils::SwitchStation(mIDs[from], mIDs[to], mListeners[slot].get()); });
        mModel.Switch(from, to, mModel.Slot(slot).mNumber, main);
        return "SwitchStation(" + Name(from) + ", " + Name(to) + ", L" + std::to_string(mModel.Slot(slot).mNumber) + ")";
      }
      case 14: {
        const int id = AnyID();
        OnThread([&] { Utils::RetainStation(mIDs[id]); });
        mModel.UtilsRetain(id, main);
        return "StationUtils::RetainStation(" + Name(id) + ")";
      }
      case 16: {
        const int slot = AnySlot();
        const int number = mModel.Slot(slot).mNumber;
        OnThread([&] { mListeners[slot].reset(); });
        mModel.DestroyListener(slot);
        NewListener(slot);
        return "destroy L" + std::to_string(number);
      }
      case 17: {
        ImmutableString id;
        Tarn::Station* found = nullptr;
        OnThread([&] {
          id = Registry::UniqueStationID();
          found = Registry::FindStation(id);
        });
        EXPECT_EQ(found, nullptr) << "UniqueStationID registered its ID";
        for (const ImmutableString& known : mIDs) EXPECT_NE(known, id) << "a unique ID came twice";
        return "UniqueStationID()";
      }
    }
    return "?";
  }

  // Compares everything the test can see without changing the registry.
  void Compare() {
    const std::vector<std::string> events = Ledger::Get().Events();
    if (events != mModel.Events()) {
      ADD_FAILURE() << "the library did:  " << Join(events) << "\nthe model expects: " << Join(mModel.Events());
      return;
    }
    const auto live = Ledger::Get().Live();
    std::set<int> liveSerials;
    for (const auto& element : live) liveSerials.insert(element.first);
    std::set<int> expectedSerials;
    for (const auto& element : mModel.LiveTracked()) expectedSerials.insert(element.first);
    EXPECT_EQ(expectedSerials, liveSerials) << "stations alive";

    for (const StationRef& station : mModel.LiveStations()) {
      Tarn::Station* pointer = station->mPointer;
      if (station->mSerial != 0) {
        const auto found = live.find(station->mSerial);
        if (found == live.end()) continue;  // reported above
        pointer = found->second;
      }
      if (pointer == nullptr) continue;  // a plain station never seen yet
      for (int slot = 0; slot < kListenerSlots; ++slot) {
        const int number = mModel.Slot(slot).mNumber;
        const bool attached =
            std::find(station->mListeners.begin(), station->mListeners.end(), number) != station->mListeners.end();
        // The listener's own back-link is read without touching the station.
        EXPECT_EQ(attached, mListeners[slot]->HasBroadcaster(pointer))
            << "L" << number << " back-link to station of " << Name(station->mID);
        if (station->mSerial != 0) {
          EXPECT_EQ(attached, pointer->HasListener(mListeners[slot].get()))
              << "L" << number << " registered with station " << station->mSerial;
        }
      }
      if (station->mSerial != 0) {
        EXPECT_EQ(station->mBroadcasting, pointer->IsBroadcasting()) << "station " << station->mSerial;
      }
    }
  }

  static std::string Join(const std::vector<std::string>& inEvents) {
    std::string text;
    for (const std::string& event : inEvents) text += event + " ";
    return text;
  }

  Random mRandom;
  SequentialExecutor& mHelper;
  std::vector<ImmutableString> mIDs;  // the pool; index = the model's ID
  RegistryModel mModel;
  std::unique_ptr<ModelListener> mListeners[kListenerSlots];
  int mNextListener = 1;
  bool mOnMain = true;
};

class RegistryModelTest : public ::testing::Test {
protected:
  void SetUp() override { SmallBlockAllocator::SetFailAfter(-1); }
  void TearDown() override {
    Registry::Terminate();
    // Delete whatever a failed sequence left queued.
    const ImmutableString drain = Registry::UniqueStationID();
    Registry::RegisterStation(drain, nullptr);
    Registry::DisposeStation(drain);
  }
  messaging_test::MainThreadGuard mMainThread;
};

TEST_F(RegistryModelTest, RandomSequencesMatchTheModel) {
  messaging_test::RunRandomSequences<Sequence>("registry", 10000, 0x7e617301);
}

}  // namespace
