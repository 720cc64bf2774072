// libFuzzer target: the input bytes are read as a sequence of library
// operations on one thread (the main thread): listeners of all four kinds
// made, killed, attached and detached; broadcasts, also from handlers that
// add, remove and broadcast again; posts and flushes; the station registry
// (retain, release, dispose, register again); and an idle countdown timer
// driven by a clock that the input advances.
//
// Besides the sanitizers, the harness keeps a small model and aborts when
// the library disagrees with it:
//  - a broadcast serves each registration at most once; never one removed
//    before its turn, never one added after the broadcast began, never a
//    stopped plain listener, nothing at all while broadcasting is off;
//  - a broadcast that no handler disturbed serves every registration that
//    can be served;
//  - a retained station is never deleted by a disposal; an unretained one is
//    deleted by it at once, and so is a disposed one by its last release;
//  - registry look-ups find exactly the station the model expects;
//  - the timer fires only when armed and due, with the current cookie, and
//    never misses an undisturbed idle message once due;
//  - at the end of each input, after the library's Terminate, every station
//    and safe listener is gone and every small block is back.
//
// Build and run: fuzz/run.sh [SECONDS].
#include <TarnMessaging.h>

#include <TarnFoundation/TimeStamp.h>
#include <kivcore/kivcore.h>

#include <boost/make_shared.hpp>
#include <boost/shared_ptr.hpp>

#include <fuzzer/FuzzedDataProvider.h>

#include <array>
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <vector>

namespace {

using kivcore::utility::ImmutableString;
using kivcore::utility::SmallBlockAllocator;
namespace Registry = Tarn::StationRegistry;
namespace Utils = Tarn::StationUtils;

[[noreturn]] void Violation(const char* inWhat, int inLine) {
  std::fprintf(stderr, "tarn_fuzz_operations: invariant violated at line %d: %s\n", inLine, inWhat);
  std::abort();
}
#define FUZZ_CHECK(condition, what)                  \
  do {                                               \
    if (!(condition)) Violation((what), __LINE__);   \
  } while (false)

constexpr int kObjects = 6;
// Broadcaster 0 stands alone; 1 and 2 are registry stations made by the
// harness's factory; 3 is the idle station, where the timer listens.
constexpr int kBroadcasters = 4;
constexpr int kFirstTracked = 1;
constexpr int kLastTracked = 2;
constexpr int kIdle = 3;
constexpr std::size_t kMaxDepth = 3;
constexpr int kMaxOperations = 400;
constexpr int kMaxHandlerActions = 300;

enum class Way { kPlain, kBoost, kStd, kSafe };

class World;
World* gWorld = nullptr;
double gNowMilliSeconds = 0;

// A message for one of the broadcasters; posted ones report when their
// delivery runs, so that the harness knows a broadcast has begun.
struct FuzzMessage : Tarn::MessageImpl<FuzzMessage> {
  explicit FuzzMessage(int inTarget) : mTarget(inTarget) {}
  int mTarget;
};
struct PostedMessage : Tarn::MessageImpl<PostedMessage> {
  explicit PostedMessage(int inTarget) : mTarget(inTarget) {}
  boost::function<void()> CreateCallback(const ImmutableString& inStationID) const override;
  int mTarget;
};

// The broadcaster a delivered message belongs to.
int TargetOf(const Tarn::Message& inMessage) {
  if (inMessage.GetMessageID() == FuzzMessage::StaticMessageID())
    return static_cast<const FuzzMessage&>(inMessage).mTarget;
  if (inMessage.GetMessageID() == PostedMessage::StaticMessageID())
    return static_cast<const PostedMessage&>(inMessage).mTarget;
  if (inMessage.GetMessageID() == Tarn::ApplicationIdleMessage::StaticMessageID()) return kIdle;
  return -1;
}

class FuzzListener : public Tarn::Listener {
public:
  explicit FuzzListener(int inObject) : mObject(inObject) {}
  void ListenToMessage(const Tarn::Message& inMessage) override;

private:
  const int mObject;
};

class FuzzSafeListener : public Tarn::SafeListenerBase {
public:
  explicit FuzzSafeListener(int inObject) : mObject(inObject) { ++sLive; }
  void ListenToMessage(const Tarn::Message& inMessage) override;
  static inline int sLive = 0;

protected:
  ~FuzzSafeListener() override { --sLive; }

private:
  const int mObject;
};

// Stations of the tracked IDs tell the harness when they come and go.
class FuzzStation : public Tarn::Station {
public:
  FuzzStation(const ImmutableString& inStationID, int inIndex);
  ~FuzzStation() override;
  static inline int sLive = 0;

private:
  const int mIndex;
};

// Hears the timer's own station.
class TimerListener : public Tarn::Listener {
public:
  void ListenToMessage(const Tarn::Message& inMessage) override;
};

struct Object {
  Way mWay = Way::kPlain;
  std::unique_ptr<FuzzListener> mPlain;
  boost::shared_ptr<FuzzListener> mBoost;
  std::shared_ptr<FuzzListener> mStd;
  Tarn::ISafeListenerRef mSafe;
  bool mAlive = false;
  bool mListening = true;
  std::array<bool, kBroadcasters> mRegistered{};
  std::array<std::uint64_t, kBroadcasters> mAddedAt{};

  Tarn::Listener* AsListener() const {
    if (mPlain) return mPlain.get();
    if (mBoost) return mBoost.get();
    if (mStd) return mStd.get();
    return nullptr;
  }
};

// One broadcast in progress, begun by the harness.
struct Level {
  int mTarget;
  std::uint64_t mStart;       // registrations made from here on are not served
  bool mDelivers;             // broadcasting was on (and the station existed) when it began
  bool mDisturbed = false;    // a handler changed something meanwhile
  std::uint32_t mServed = 0;  // objects served, one bit each
};

struct TrackedStation {
  ImmutableString mID;
  bool mRegistered = false;
  Tarn::Station* mStation = nullptr;  // alive, as the station's own hooks say
  int mRetains = 0;                   // retains the harness holds
  bool mDisposeRequested = false;
};

class World {
public:
  explicit World(FuzzedDataProvider& ioInput) : mInput(ioInput) {
    for (int index = kFirstTracked; index <= kLastTracked; ++index) {
      mTracked[index].mID = Registry::UniqueStationID();
      Register(index);
    }
    mTracked[kIdle].mID = Tarn::kStation_Idle;
    mTracked[kIdle].mRegistered = true;
    mBroadcasting.fill(true);
    Utils::AddListener(mTimer.GetStationID(), &mTimerListener);
  }

  void Run() {
    for (int operation = 0; operation < kMaxOperations && mInput.remaining_bytes() > 0; ++operation) Step();
  }

  void Finish() {
    for (int object = 0; object < kObjects; ++object) Kill(object);
    Utils::RemoveListener(mTimer.GetStationID(), &mTimerListener);
  }

  // --- called back by the library's deliveries

  void OnCall(int inObject, const Tarn::Message& inMessage) {
    const int target = TargetOf(inMessage);
    FUZZ_CHECK(target >= 0, "a message of an unknown type was delivered");
    FUZZ_CHECK(!mLevels.empty(), "a delivery outside every broadcast");
    Level& level = mLevels.back();
    FUZZ_CHECK(level.mTarget == target, "a delivery from a broadcaster that is not broadcasting");
    FUZZ_CHECK(level.mDelivers, "a delivery while broadcasting is off");
    Object& object = mObjects[inObject];
    FUZZ_CHECK(object.mAlive, "a dead listener was called");
    FUZZ_CHECK(object.mRegistered[target], "a listener was called by a broadcaster it is not registered with");
    FUZZ_CHECK(object.mAddedAt[target] < level.mStart, "a listener added during a broadcast was served by it");
    FUZZ_CHECK(object.mWay != Way::kPlain || object.mListening, "a stopped plain listener was called");
    FUZZ_CHECK((level.mServed & (1u << inObject)) == 0, "a listener was served twice by one broadcast");
    level.mServed |= 1u << inObject;
    if (mHandlerActions >= kMaxHandlerActions) return;
    const int action = mInput.ConsumeIntegralInRange<int>(0, 9);
    if (action >= 6) return;  // most handlers do nothing else
    ++mHandlerActions;
    for (Level& running : mLevels) running.mDisturbed = true;
    const int other = mInput.ConsumeIntegralInRange<int>(0, kObjects - 1);
    const int broadcaster = mInput.ConsumeIntegralInRange<int>(0, kBroadcasters - 1);
    switch (action) {
      case 0:
        Remove(inObject, target);
        break;
      case 1:
        Add(other, broadcaster);
        break;
      case 2:
        Remove(other, broadcaster);
        break;
      case 3:
        if (mLevels.size() < kMaxDepth) Broadcast(broadcaster);
        break;
      case 4:
        Post(broadcaster);
        break;
      case 5:
        SetListening(other, mInput.ConsumeBool());
        break;
    }
  }

  void OnStation(int inIndex, Tarn::Station* inStation) {
    TrackedStation& tracked = mTracked[inIndex];
    if (inStation != nullptr) {
      FUZZ_CHECK(tracked.mStation == nullptr, "two stations of one ID alive");
      mBroadcasting[inIndex] = true;
    } else {
      FUZZ_CHECK(tracked.mRetains == 0 || mTerminating, "a retained station was deleted");
      // Its registrations go with it.
      for (Object& object : mObjects) object.mRegistered[inIndex] = false;
    }
    tracked.mStation = inStation;
  }

  void OnTimerFired(const Tarn::Message& inMessage) {
    FUZZ_CHECK(inMessage.GetMessageID() == Tarn::IdleCountdownTimerMessage::StaticMessageID(),
               "the timer's station carried another message");
    FUZZ_CHECK(mTimerArmed, "the timer fired without being armed");
    FUZZ_CHECK(TimerDue(), "the timer fired before its deadline");
    FUZZ_CHECK(static_cast<const Tarn::IdleCountdownTimerMessage&>(inMessage).GetCookie() == mTimerCookie,
               "the timer fired with another cookie");
    mTimerArmed = false;
  }

  // A posted message's delivery begins and ends.
  void RunPosted(int inTarget, const boost::function<void()>& inDeliver) {
    BeginLevel(inTarget);
    inDeliver();
    mLevels.pop_back();
  }

  void SetTerminating() { mTerminating = true; }
  static int Live() { return FuzzStation::sLive; }

private:
  static std::uint32_t Now() { return static_cast<std::uint32_t>(static_cast<std::int64_t>(gNowMilliSeconds)); }
  // The deadline is reached when now is not before it on the wrapping 32-bit
  // clock (serial-number order: within 2^31 ms).
  bool TimerDue() const { return static_cast<std::int32_t>(Now() - mTimerDeadline) >= 0; }

  int AnyObject() { return mInput.ConsumeIntegralInRange<int>(0, kObjects - 1); }
  int AnyBroadcaster() { return mInput.ConsumeIntegralInRange<int>(0, kBroadcasters - 1); }
  int AnyTracked() { return mInput.ConsumeIntegralInRange<int>(kFirstTracked, kLastTracked); }

  // Whether broadcaster inTarget exists now.
  bool Exists(int inTarget) const { return inTarget == 0 || mTracked[inTarget].mStation != nullptr || inTarget == kIdle; }

  void Step() {
    switch (mInput.ConsumeIntegralInRange<int>(0, 19)) {
      case 0:
        Create(AnyObject(), static_cast<Way>(mInput.ConsumeIntegralInRange<int>(0, 3)));
        break;
      case 1:
        Kill(AnyObject());
        break;
      case 2:
      case 3: {
        const int object = AnyObject();
        Add(object, AnyBroadcaster());
        break;
      }
      case 4: {
        const int object = AnyObject();
        Remove(object, AnyBroadcaster());
        break;
      }
      case 5:
        SetListening(AnyObject(), mInput.ConsumeBool());
        break;
      case 6:
      case 7:
        Broadcast(AnyBroadcaster());
        break;
      case 8:
        Post(AnyBroadcaster());
        break;
      case 9:
        Utils::FlushPostedMessagesOnUIThread();
        break;
      case 10:
        Retain(AnyTracked());
        break;
      case 11:
        Release(AnyTracked());
        break;
      case 12:
        Dispose(AnyTracked());
        break;
      case 13:
        Register(AnyTracked());
        break;
      case 14:
        SetBroadcasting(AnyBroadcaster(), mInput.ConsumeBool());
        break;
      case 15:
        mTimerDuration = mInput.ConsumeIntegralInRange<std::uint32_t>(0, 2000);
        mTimer.SetDuration(mTimerDuration);
        break;
      case 16:
        mTimerDeadline = Now() + mTimerDuration;
        mTimerArmed = true;
        mTimer.ArmTimer();
        break;
      case 17:
        mTimerCookie = mInput.ConsumeIntegral<std::uint32_t>();
        mTimer.SetCookie(mTimerCookie);
        break;
      case 18:
        gNowMilliSeconds += mInput.ConsumeIntegralInRange<int>(0, 1500);
        break;
      case 19:
        Query(AnyObject(), AnyBroadcaster());
        break;
    }
  }

  // --- listeners

  void Create(int inObject, Way inWay) {
    Kill(inObject);
    Object& object = mObjects[inObject];
    object = Object();
    object.mWay = inWay;
    object.mAlive = true;
    switch (inWay) {
      case Way::kPlain:
        object.mPlain = std::make_unique<FuzzListener>(inObject);
        break;
      case Way::kBoost:
        object.mBoost = boost::make_shared<FuzzListener>(inObject);
        break;
      case Way::kStd:
        object.mStd = std::make_shared<FuzzListener>(inObject);
        break;
      case Way::kSafe:
        object.mSafe = Tarn::ISafeListenerRef(new FuzzSafeListener(inObject));
        break;
    }
  }

  // Only ever from the top level: no delivery to the object is running.
  void Kill(int inObject) {
    Object& object = mObjects[inObject];
    if (!object.mAlive) return;
    object.mAlive = false;
    object.mRegistered.fill(false);  // plain ones detach themselves; weak and safe ones can no longer be reached
    object.mPlain.reset();
    object.mBoost.reset();
    object.mStd.reset();
    object.mSafe = nullptr;
  }

  void Add(int inObject, int inTarget) {
    Object& object = mObjects[inObject];
    if (!object.mAlive) return;
    if (inTarget == 0) {
      AddTo(mBroadcaster, object);
    } else {
      const ImmutableString& id = mTracked[inTarget].mID;
      switch (object.mWay) {
        case Way::kPlain:
          Utils::AddListener(id, object.mPlain.get());
          break;
        case Way::kBoost:
          Utils::AddListener(id, boost::weak_ptr<Tarn::Listener>(object.mBoost));
          break;
        case Way::kStd:
          Utils::AddListener(id, std::weak_ptr<Tarn::Listener>(object.mStd));
          break;
        case Way::kSafe:
          Utils::AddListener(id, object.mSafe);
          break;
      }
    }
    if (Exists(inTarget) && !object.mRegistered[inTarget]) {
      object.mRegistered[inTarget] = true;
      object.mAddedAt[inTarget] = mClock++;
    }
  }

  static void AddTo(Tarn::Broadcaster& ioBroadcaster, Object& ioObject) {
    switch (ioObject.mWay) {
      case Way::kPlain:
        ioBroadcaster.AddListener(ioObject.mPlain.get());
        break;
      case Way::kBoost:
        ioBroadcaster.AddListener(boost::weak_ptr<Tarn::Listener>(ioObject.mBoost));
        break;
      case Way::kStd:
        ioBroadcaster.AddListener(std::weak_ptr<Tarn::Listener>(ioObject.mStd));
        break;
      case Way::kSafe:
        ioBroadcaster.AddListener(ioObject.mSafe);
        break;
    }
  }

  void Remove(int inObject, int inTarget) {
    Object& object = mObjects[inObject];
    if (!object.mAlive) return;
    if (inTarget == 0) {
      switch (object.mWay) {
        case Way::kPlain:
          mBroadcaster.RemoveListener(object.mPlain.get(), true);
          break;
        case Way::kBoost:
          mBroadcaster.RemoveListener(boost::weak_ptr<Tarn::Listener>(object.mBoost));
          break;
        case Way::kStd:
          mBroadcaster.RemoveListener(std::weak_ptr<Tarn::Listener>(object.mStd));
          break;
        case Way::kSafe:
          mBroadcaster.RemoveListener(object.mSafe);
          break;
      }
    } else {
      const ImmutableString& id = mTracked[inTarget].mID;
      switch (object.mWay) {
        case Way::kPlain:
          Utils::RemoveListener(id, object.mPlain.get());
          break;
        case Way::kBoost:
          Utils::RemoveListener(id, boost::weak_ptr<Tarn::Listener>(object.mBoost));
          break;
        case Way::kStd:
          Utils::RemoveListener(id, std::weak_ptr<Tarn::Listener>(object.mStd));
          break;
        case Way::kSafe:
          Utils::RemoveListener(id, object.mSafe);
          break;
      }
    }
    object.mRegistered[inTarget] = false;
    if (object.mWay == Way::kPlain && inTarget == 0) {
      FUZZ_CHECK(!object.mPlain->HasBroadcaster(&mBroadcaster), "a removed plain listener kept its back-link");
    }
  }

  void SetListening(int inObject, bool inListening) {
    Object& object = mObjects[inObject];
    Tarn::Listener* listener = object.mAlive ? object.AsListener() : nullptr;
    if (listener == nullptr) return;
    if (inListening) listener->StartListening();
    else listener->StopListening();
    object.mListening = inListening;
  }

  // What the registry answers, against the model.
  void Query(int inObject, int inTarget) {
    Object& object = mObjects[inObject];
    Tarn::Broadcaster* broadcaster = inTarget == 0 ? &mBroadcaster : mTracked[inTarget].mStation;
    if (broadcaster == nullptr || !object.mAlive || object.mWay != Way::kPlain) return;
    FUZZ_CHECK(broadcaster->HasListener(object.mPlain.get()) == object.mRegistered[inTarget],
               "HasListener disagrees with the model");
    FUZZ_CHECK(object.mPlain->HasBroadcaster(broadcaster) == object.mRegistered[inTarget],
               "a back-link disagrees with the registration");
  }

  // --- broadcasts

  void BeginLevel(int inTarget) {
    Level level;
    level.mTarget = inTarget;
    level.mStart = mClock++;
    level.mDelivers = Exists(inTarget) && mBroadcasting[inTarget];
    mLevels.push_back(level);
  }

  void Broadcast(int inTarget) {
    BeginLevel(inTarget);
    const bool timerDue = mTimerArmed && TimerDue();
    if (inTarget == 0) {
      mBroadcaster.BroadcastMessage(FuzzMessage(0));
    } else if (inTarget == kIdle) {
      Utils::BroadcastMessage(Tarn::kStation_Idle, Tarn::ApplicationIdleMessage());
    } else {
      Utils::BroadcastMessage(mTracked[inTarget].mID, FuzzMessage(inTarget));
    }
    const Level level = mLevels.back();
    mLevels.pop_back();
    if (level.mDisturbed || !level.mDelivers) return;
    for (int index = 0; index < kObjects; ++index) {
      const Object& object = mObjects[index];
      const bool servable = object.mAlive && object.mRegistered[inTarget] && object.mAddedAt[inTarget] < level.mStart &&
                            (object.mWay != Way::kPlain || object.mListening);
      FUZZ_CHECK(!servable || (level.mServed & (1u << index)) != 0, "an undisturbed broadcast skipped a listener");
    }
    if (inTarget == kIdle && mLevels.empty()) {
      FUZZ_CHECK(!timerDue || !mTimerArmed, "the timer missed an idle message after its deadline");
    }
  }

  // Deferred, or (on this, the main thread) delivered at once, which is a
  // broadcast like any other.
  void Post(int inTarget) {
    if (inTarget == 0) return;  // a broadcaster without an ID cannot be posted to
    const bool deferred = mInput.ConsumeBool() || mLevels.size() >= kMaxDepth;
    if (deferred) {
      Utils::PostMessageToUIThread(mTracked[inTarget].mID, PostedMessage(inTarget), true);
      return;
    }
    BeginLevel(inTarget);
    Utils::PostMessageToUIThread(mTracked[inTarget].mID, PostedMessage(inTarget), false);
    mLevels.pop_back();
  }

  void SetBroadcasting(int inTarget, bool inOn) {
    if (inTarget == 0) {
      if (inOn) mBroadcaster.StartBroadcasting();
      else mBroadcaster.StopBroadcasting();
    } else if (inOn) {
      Utils::StartBroadcasting(mTracked[inTarget].mID);
    } else {
      Utils::StopBroadcasting(mTracked[inTarget].mID);
    }
    if (Exists(inTarget)) mBroadcasting[inTarget] = inOn;
  }

  // --- the registry

  void Register(int inIndex) {
    TrackedStation& tracked = mTracked[inIndex];
    Registry::RegisterStation(tracked.mID, &MakeStation);
    if (!tracked.mRegistered) {
      tracked.mRegistered = true;
      tracked.mRetains = 0;
      tracked.mDisposeRequested = false;
    }
  }

  static Tarn::Station* MakeStation(const ImmutableString& inStationID);

  void Retain(int inIndex) {
    TrackedStation& tracked = mTracked[inIndex];
    Tarn::Station* station = Registry::RetainStation(tracked.mID);
    FUZZ_CHECK((station != nullptr) == tracked.mRegistered, "RetainStation disagrees with the registrations");
    if (station == nullptr) return;
    FUZZ_CHECK(station == tracked.mStation, "RetainStation returned another station");
    ++tracked.mRetains;
  }

  void Release(int inIndex) {
    TrackedStation& tracked = mTracked[inIndex];
    if (tracked.mRetains == 0) return;  // only what was retained is released
    --tracked.mRetains;
    Registry::ReleaseStation(tracked.mID);
    if (tracked.mRetains == 0 && tracked.mDisposeRequested) {
      FUZZ_CHECK(tracked.mStation == nullptr, "the last release of a disposed station did not delete it");
      tracked.mRegistered = false;
      tracked.mDisposeRequested = false;
    } else {
      FUZZ_CHECK(tracked.mStation != nullptr, "a release deleted a station that was still wanted");
    }
  }

  void Dispose(int inIndex) {
    TrackedStation& tracked = mTracked[inIndex];
    Registry::DisposeStation(tracked.mID);
    if (!tracked.mRegistered) return;
    if (tracked.mRetains > 0) {
      FUZZ_CHECK(tracked.mStation != nullptr, "a disposal deleted a retained station");
      tracked.mDisposeRequested = true;
    } else {
      FUZZ_CHECK(tracked.mStation == nullptr, "a disposal on the main thread did not delete an unretained station");
      FUZZ_CHECK(Registry::FindStation(tracked.mID) == nullptr, "a disposed ID is still registered");
      tracked.mRegistered = false;
    }
  }

  FuzzedDataProvider& mInput;
  std::array<Object, kObjects> mObjects;
  std::array<TrackedStation, kBroadcasters> mTracked;
  std::array<bool, kBroadcasters> mBroadcasting{};
  std::vector<Level> mLevels;
  std::uint64_t mClock = 1;  // orders registrations and broadcast starts
  int mHandlerActions = 0;
  bool mTerminating = false;

  Tarn::Broadcaster mBroadcaster;
  Tarn::IdleCountdownTimer mTimer;
  TimerListener mTimerListener;
  std::uint32_t mTimerDuration = 0;
  std::uint32_t mTimerDeadline = 0;
  std::uint32_t mTimerCookie = 0;
  bool mTimerArmed = false;
};

// The tracked station's index is found from its ID.
Tarn::Station* World::MakeStation(const ImmutableString& inStationID) {
  for (int index = kFirstTracked; index <= kLastTracked; ++index) {
    if (gWorld->mTracked[index].mID == inStationID) return new FuzzStation(inStationID, index);
  }
  Violation("the factory was asked for an unknown ID", __LINE__);
}

FuzzStation::FuzzStation(const ImmutableString& inStationID, int inIndex) : Tarn::Station(inStationID), mIndex(inIndex) {
  ++sLive;
  gWorld->OnStation(mIndex, this);
}
FuzzStation::~FuzzStation() {
  --sLive;
  gWorld->OnStation(mIndex, nullptr);
}

void FuzzListener::ListenToMessage(const Tarn::Message& inMessage) { gWorld->OnCall(mObject, inMessage); }
void FuzzSafeListener::ListenToMessage(const Tarn::Message& inMessage) { gWorld->OnCall(mObject, inMessage); }
void TimerListener::ListenToMessage(const Tarn::Message& inMessage) { gWorld->OnTimerFired(inMessage); }

boost::function<void()> PostedMessage::CreateCallback(const ImmutableString& inStationID) const {
  boost::function<void()> deliver = Tarn::MessageImpl<PostedMessage>::CreateCallback(inStationID);
  const int target = mTarget;
  return [deliver, target] { gWorld->RunPosted(target, deliver); };
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  Tarn::TimeStamp::SetClockForTesting([] { return gNowMilliSeconds; });
  // Contract reports would throw; the harness makes no bad calls, so any
  // report is a failure.
  kivcore::config::SetErrorHandler([](const kivcore::config::ErrorReport& inReport) {
    std::fprintf(stderr, "tarn_fuzz_operations: unexpected contract report: %s\n", inReport.key.c_str());
    std::abort();
  });
  kivcore::config::ErrorManager::SetExceptionHandler([](std::exception_ptr) {
    std::fprintf(stderr, "tarn_fuzz_operations: a handler raised an exception\n");
    std::abort();
  });
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* inData, std::size_t inSize) {
  const std::size_t baseline = SmallBlockAllocator::GetStatistics().blocksInUse;
  FuzzedDataProvider input(inData, inSize);
  // Half the inputs start just before the millisecond clock's low 32 bits
  // wrap, where deadlines wrap too.
  gNowMilliSeconds = input.ConsumeBool() ? 4294967296.0 - 3000.0 : 1000.0;
  Tarn::Messaging::Initialize();
  {
    World world(input);
    gWorld = &world;
    world.Run();
    world.Finish();
    Utils::FlushPostedMessagesOnUIThread();
    world.SetTerminating();
    Tarn::Messaging::Terminate();
    FUZZ_CHECK(World::Live() == 0, "stations outlived the library's Terminate");
  }
  gWorld = nullptr;
  FUZZ_CHECK(FuzzSafeListener::sLive == 0, "safe listeners outlived their last reference");
  FUZZ_CHECK(SmallBlockAllocator::GetStatistics().blocksInUse == baseline, "small blocks leaked by the input");
  return 0;
}
