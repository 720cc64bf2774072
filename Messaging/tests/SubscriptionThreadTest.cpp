// Registrations: each of the five kinds (four held listeners and a typed
// subscription) detaches when destroyed, on a broadcaster and on a station by
// ID; a move hands the registration over and Release keeps the listener
// attached; a typed handler sees only its type and may end its own
// subscription; the broadcaster or station may die first; and a registration
// destroyed on a worker during its handler returns only after the handler.
#include "StationTestSupport.h"

#include <TarnMessaging/Subscription.h>

namespace {

using kivcore::utility::ImmutableString;
using namespace messaging_test;
using Tarn::Registration;

// One listener of each kind a registration can hold; every handler runs
// mAction (set before attaching) and is counted.
struct Listeners {
  static constexpr int kKinds = 5;
  Listeners() {
    for (AnyListener& listener : mHeld) listener.SetAction([this](const Tarn::Message&) { Hook(); });
  }
  void Hook() const {
    if (mAction) mAction();
  }

  template <class Target>
  Registration Attach(Target& ioTarget, int inKind) {
    Registration made;
    if (inKind < 4) mHeld[inKind].WithHandle([&](const auto& inHandle) { made = Tarn::Attach(ioTarget, inHandle); });
    else made = Tarn::Subscribe<NumberMessage>(ioTarget, [this](const NumberMessage&) { ++mTyped, Hook(); });
    return made;
  }
  int Calls(int inKind) const { return inKind < 4 ? mHeld[inKind].Calls() : mTyped.load(); }

  std::function<void()> mAction;
  AnyListener mHeld[4] = {{ListenerKind::kPlainPointer, "plain"}, {ListenerKind::kBoostWeak, "boost"},
                          {ListenerKind::kStdWeak, "std"}, {ListenerKind::kSafe, "safe"}};
  std::atomic<int> mTyped{0};
};

void Send(Tarn::Broadcaster& ioBroadcaster, int inValue) { ioBroadcaster.BroadcastMessage(NumberMessage(inValue)); }
void Send(const ImmutableString& inStationID, int inValue) {
  Tarn::StationUtils::BroadcastMessage(inStationID, NumberMessage(inValue));
}

class SubscriptionTest : public station_test::RegistryTest {};

TEST_F(SubscriptionTest, EveryKindDetachesOnDestructionMovesAndIsKeptByRelease) {
  Tarn::Broadcaster broadcaster;
  const ImmutableString station = MakeCounted();
  auto check = [](auto& ioTarget, int inKind) {
    Listeners listeners;
    Registration first = listeners.Attach(ioTarget, inKind);
    ASSERT_TRUE(first);
    Send(ioTarget, 1);
    Registration moved(std::move(first));
    first.Reset();
    first = std::move(moved);  // and back, by assignment
    moved.Reset();
    Send(ioTarget, 2);  // neither moved-from registration detached anything
    EXPECT_EQ(2, listeners.Calls(inKind));
    first = Registration();  // the assignment detaches the one it replaces
    Send(ioTarget, 3);
    EXPECT_EQ(2, listeners.Calls(inKind));
    if (inKind == 4) return;  // a released subscription would stay attached for good
    Registration released = listeners.Attach(ioTarget, inKind);
    released.Release();
    released.Reset();
    Send(ioTarget, 4);
    EXPECT_EQ(3, listeners.Calls(inKind));
  };
  for (int kind = 0; kind < Listeners::kKinds; ++kind) {
    SCOPED_TRACE(kind);
    check(broadcaster, kind);
    check(station, kind);
  }
}

TEST_F(SubscriptionTest, TypedHandlerSeesOnlyItsTypeAndMayEndItsOwnSubscription) {
  struct Window {
    std::vector<int> mSeen;
    void OnNumber(const NumberMessage& inMessage) { mSeen.push_back(inMessage.mValue); }
  } window;
  const ImmutableString station = MakeCounted();
  Registration member = Tarn::Subscribe<NumberMessage>(station, &window, &Window::OnNumber);
  std::vector<std::string> oneShot;
  Registration self;
  // The capture is read after the handler reset its own registration: it
  // must still be alive then (ASan).
  self = Tarn::Subscribe<NumberMessage>(station, [&, tag = std::string(40, 'x')](const NumberMessage&) {
    self.Reset();
    Send(station, 9);  // a nested broadcast no longer reaches it
    oneShot.push_back(tag);
  });
  Tarn::StationUtils::BroadcastMessage(station, messaging_test::PingMessage());
  Send(station, 7);
  Send(station, 8);
  EXPECT_EQ((std::vector<int>{9, 7, 8}), window.mSeen);
  EXPECT_EQ(std::vector<std::string>{std::string(40, 'x')}, oneShot);
  EXPECT_FALSE(self);
  // Ended outside its handler, on the main thread or a worker, it is freed at once.
  auto token = std::make_shared<int>(0);
  Registration onMain = Tarn::Subscribe<NumberMessage>(station, [token](const NumberMessage&) {});
  Registration onWorker = Tarn::Subscribe<NumberMessage>(station, [token](const NumberMessage&) {});
  onMain.Reset();
  std::thread([&] { onWorker.Reset(); }).join();
  EXPECT_EQ(token.use_count(), 1) << "an ended subscription was never freed";
}

TEST_F(SubscriptionTest, BroadcasterOrStationGoneFirstAndBadInputLeaveNothingToDetach) {
  for (int kind = 0; kind < 2 * Listeners::kKinds; ++kind) {
    // In the second round the broadcaster goes from one of its handlers,
    // whose broadcast still holds the closed core when the registration
    // detaches from it.
    const bool fromHandler = kind >= Listeners::kKinds;
    SCOPED_TRACE(kind);
    Listeners listeners;
    auto broadcaster = std::make_unique<Tarn::Broadcaster>();
    const ImmutableString station = MakeCounted();
    Registration onBroadcaster, onStation;
    listeners.mAction = [&] {
      broadcaster.reset();
      onBroadcaster.Reset();
    };
    onBroadcaster = listeners.Attach(*broadcaster, kind % Listeners::kKinds);
    onStation = listeners.Attach(station, kind % Listeners::kKinds);
    if (fromHandler) {
      broadcaster->BroadcastMessage(NumberMessage(1));
      EXPECT_EQ(broadcaster, nullptr) << "the handler did not run";
    }
    broadcaster.reset();
    Tarn::StationRegistry::DisposeStation(station);
    ASSERT_EQ(nullptr, Tarn::StationRegistry::RetainStation(station));
    // The registrations left are destroyed here, after what they were attached to.
  }
  messaging_test::ContractDialogRecorder dialogs;
  messaging_test::ErrorRecorder errors;
  Tarn::Broadcaster broadcaster;
  EXPECT_FALSE(Tarn::Attach(broadcaster, static_cast<Tarn::Listener*>(nullptr)));
  EXPECT_FALSE(Tarn::Attach(broadcaster, std::weak_ptr<Tarn::Listener>()));
  EXPECT_FALSE(Tarn::Attach(broadcaster, Tarn::ISafeListenerRef()));
  EXPECT_EQ(4u, dialogs.Count());
  Listeners listeners;
  const ImmutableString unknown = Tarn::StationRegistry::UniqueStationID();
  for (int kind = 0; kind < Listeners::kKinds; ++kind) EXPECT_FALSE(listeners.Attach(unknown, kind));
}

TEST_F(SubscriptionTest, DestroyedOnAWorkerDuringItsHandlerReturnsOnlyAfterTheHandler) {
  for (int kind = 0; kind < Listeners::kKinds; ++kind) {
    SCOPED_TRACE(kind);
    Tarn::Broadcaster broadcaster;
    Listeners listeners;
    messaging_test::Latch entered, workerStarted;
    std::atomic<bool> handlerReturned{false}, destroyed{false};
    listeners.mAction = [&] {
      if (entered.IsReleased()) return;
      entered.CountDown();
      EXPECT_TRUE(workerStarted.WaitFor());
      // A destructor that did not wait would return within this window.
      EXPECT_FALSE(messaging_test::WaitUntil([&] { return destroyed.load(); }, std::chrono::milliseconds(50)));
      handlerReturned = true;
    };
    std::optional<Registration> registration(listeners.Attach(broadcaster, kind));
    messaging_test::ThreadGroup workers;
    workers.Start([&] {
      EXPECT_TRUE(entered.WaitFor());
      workerStarted.CountDown();
      registration.reset();
      EXPECT_TRUE(handlerReturned.load());
      destroyed = true;
    });
    Send(broadcaster, 1);
    workers.JoinAll();
    Send(broadcaster, 2);
    EXPECT_EQ(1, listeners.Calls(kind));
    EXPECT_FALSE(broadcaster.HasListeners());
  }
}

}  // namespace
