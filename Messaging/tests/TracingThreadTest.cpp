// Diagnostics of delivery: the tracer hears each delivery exactly once with
// what it needs to name it, a removal stuck behind a slow handler says so
// once and still waits, and (in debug builds) destroying what a delivery
// still uses is reported instead of passing in silence.
#include "TestSupport.h"

#include <TarnMessaging/IdleCountdownTimer.h>
#include <TarnMessaging/Station.h>
#include <TarnMessaging/StationRegistry.h>
#include <TarnMessaging/Subscription.h>
#include <TarnMessaging/Tracing.h>

#include <optional>
#include <stdexcept>
#include <tuple>

namespace {

using namespace messaging_test;
using Kind = Tarn::Tracing::ListenerKind;
using std::chrono::milliseconds;

#ifdef NDEBUG
constexpr std::size_t kDebugReports = 0;
#else
constexpr std::size_t kDebugReports = 1;
#endif

std::string Address(const void* inAddress) {
  char text[32];
  std::snprintf(text, sizeof text, "%p", inAddress);
  return text;
}

// Records "<station or ->/<type>/<kind>/<listener>/<thread is main>" for
// each ended delivery; begins and ends must pair up, innermost first.
class RecordingTracer : public Tarn::Tracing::DeliveryTracer {
public:
  void DeliveryBegins(const Tarn::Tracing::Delivery& inDelivery) override { mOpen.push_back(inDelivery.mListener); }
  void DeliveryEnded(const Tarn::Tracing::Delivery& inDelivery, std::chrono::nanoseconds inDuration) override {
    if (mOpen.empty() || mOpen.back() != inDelivery.mListener) mUnpaired = true;
    if (!mOpen.empty()) mOpen.pop_back();
    const std::string station = inDelivery.mStationID.empty() ? "-" : inDelivery.mStationID.c_str();
    mEnded.push_back(station + "/" + Tarn::Tracing::ReadableTypeName(inDelivery.mMessageType) + "/" +
                     std::to_string(static_cast<int>(inDelivery.mListenerKind)) + "/" + Address(inDelivery.mListener) +
                     (inDelivery.mThread == std::this_thread::get_id() ? "" : "/elsewhere"));
    mLongest = std::max(mLongest, inDuration);
    if (mOnEnded) mOnEnded();
  }
  std::vector<std::string> mEnded;
  std::vector<const void*> mOpen;
  bool mUnpaired = false;
  std::chrono::nanoseconds mLongest{0};
  std::function<void()> mOnEnded;
};

struct TracerGuard {
  explicit TracerGuard(Tarn::Tracing::DeliveryTracer* inTracer) { Tarn::Tracing::SetDeliveryTracer(inTracer); }
  ~TracerGuard() { Tarn::Tracing::SetDeliveryTracer(nullptr); }
};

TEST(Tracing, EachDeliveryIsTracedOnceWithStationTypeAndListenerAndNoneAfterTheTracerIsReplaced) {
  messaging_test::MainThreadGuard mainThread;
  messaging_test::ExceptionRecorder exceptions;
  RecordingTracer tracer;
  const TracerGuard installed(&tracer);
  Tarn::Station station(Tarn::StationRegistry::UniqueStationID());
  Tarn::Broadcaster bare;
  RecordingListener plain("plain"), inner("inner");
  auto weak = std::make_shared<RecordingListener>("weak");
  const Tarn::ISafeListenerRef safe(new messaging_test::CountedSafeListener("safe"));
  const void* const safeObject = static_cast<Tarn::IRefCounted*>(static_cast<Tarn::ISafeListener*>(safe.get()));
  // A slow handler that throws and broadcasts on a bare broadcaster first.
  plain.SetAction([&](const Tarn::Message& inMessage) {
    if (!inMessage.Is<NumberMessage>()) return;
    bare.BroadcastMessage(PingMessage());
    std::this_thread::sleep_for(milliseconds(3));
    throw std::runtime_error("plain failed");
  });
  // A tracer that broadcasts must not hear its own broadcast.
  RecordingListener echo("echo");
  bare.AddListener(&echo);
  tracer.mOnEnded = [&] { bare.BroadcastMessage(PingMessage()); };
  bare.AddListener(&inner);
  station.AddListener(&plain);
  station.AddListener(std::weak_ptr<Tarn::Listener>(weak));
  station.AddListener(safe);
  // Subscriptions to other message types are passed over: no call, no trace.
  const Tarn::Registration others[] = {Tarn::Subscribe<PingMessage>(station, [](const PingMessage&) {}),
                                       Tarn::Subscribe<NumberMessage>(bare, [](const NumberMessage&) {})};
  station.BroadcastMessage(NumberMessage(1));

  const std::string id = station.GetStationID().c_str(), number = "messaging_test::NumberMessage";
  const std::string ping = "-/messaging_test::PingMessage/0/";
  EXPECT_EQ(tracer.mEnded, (std::vector<std::string>{id + "/" + number + "/1/" + Address(safeObject),
                                                     id + "/" + number + "/3/" + Address(weak.get()),
                                                     ping + Address(&inner), ping + Address(&echo),
                                                     id + "/" + number + "/0/" + Address(&plain)}));
  EXPECT_FALSE(tracer.mUnpaired) << "a begin and its end did not pair up";
  EXPECT_GE(tracer.mLongest, milliseconds(3)) << "the slow handler's time was not measured";
  EXPECT_EQ(exceptions.Count(), 1u) << "the handler's exception must still reach the error manager";
  EXPECT_GE(echo.Calls(), 5) << "the tracer's own broadcasts must still deliver";
  EXPECT_EQ(Tarn::Tracing::ReadableTypeName("no type"), "no type");
  EXPECT_THROW(Tarn::Tracing::ReadableTypeName(nullptr), kivcore::config::Error);
  {
    messaging_test::ErrorRecorder returning;
    EXPECT_EQ(Tarn::Tracing::ReadableTypeName(nullptr), "") << "a returned report must not let the null through";
  }

  // Replaced by a handler: the running broadcast keeps its tracer to the end.
  tracer.mEnded.clear();
  tracer.mOnEnded = nullptr;
  plain.SetAction([](const Tarn::Message&) { Tarn::Tracing::SetDeliveryTracer(nullptr); });
  station.BroadcastMessage(NumberMessage(2));
  EXPECT_EQ(tracer.mEnded.size(), 3u);
  station.BroadcastMessage(NumberMessage(3));
  EXPECT_EQ(tracer.mEnded.size(), 3u) << "a replaced tracer was called by a later broadcast";

  // A tracer that throws costs no listener its message.
  struct Throwing : Tarn::Tracing::DeliveryTracer {
    void DeliveryBegins(const Tarn::Tracing::Delivery&) override { throw std::runtime_error("tracer failed"); }
    void DeliveryEnded(const Tarn::Tracing::Delivery&, std::chrono::nanoseconds) override {}
  } throwing;
  Tarn::Tracing::SetDeliveryTracer(&throwing);
  const int heard = inner.Calls() + echo.Calls();
  const std::size_t reported = exceptions.Count();
  bare.BroadcastMessage(PingMessage());
  EXPECT_EQ(inner.Calls() + echo.Calls(), heard + 2) << "a throwing tracer cost a delivery";
  EXPECT_EQ(exceptions.Count(), reported + 2) << "the tracer's exceptions must reach the error manager";
}

// The main thread is stuck in a nested delivery (a handler on the station
// broadcasting on another broadcaster) while a worker removes the outer
// listener: the worker reports once, naming both, and returns only when
// the handler has.
TEST(Tracing, ARemovalWaitingPastTheThresholdReportsOnceAndGoesOnWaiting) {
  messaging_test::MainThreadGuard mainThread;
  const milliseconds previous = Tarn::Tracing::SetRemovalWaitReport(milliseconds(30));
  Tarn::Station station(Tarn::StationRegistry::UniqueStationID());
  Tarn::Broadcaster nested;
  RecordingListener outer("outer"), stuck("stuck"), tick("tick");
  outer.DetachInDestructor(station);
  outer.SetAction([&](const Tarn::Message& inMessage) {
    if (inMessage.Is<NumberMessage>()) nested.BroadcastMessage(PingMessage());
  });
  station.AddListener(&tick);
  station.AddListener(&outer);
  nested.AddListener(&stuck);
  for (const bool throwingHandler : {false, true}) {
    SCOPED_TRACE(throwingHandler ? "the default error handler throws" : "a recording error handler");
    std::optional<messaging_test::ErrorRecorder> recorder;
    std::optional<messaging_test::DefaultErrorHandlerGuard> thrower;
    messaging_test::ExceptionRecorder exceptions;
    throwingHandler ? (void)thrower.emplace() : (void)recorder.emplace();
    Latch entered, release;
    std::atomic<bool> removed{false};
    stuck.SetAction([&](const Tarn::Message&) {
      entered.CountDown();
      // Deliveries on the station that end before the threshold wake the
      // remover early: it must not report then.
      for (int ticks = 0; ticks < 5; ++ticks) {
        std::this_thread::sleep_for(milliseconds(3));
        station.BroadcastMessage(PingMessage());
      }
      EXPECT_TRUE(release.WaitFor());
    });
    std::thread remover([&] {
      EXPECT_TRUE(entered.WaitFor());
      station.RemoveListener(&outer, true);
      removed.store(true);
    });
    std::thread releaser([&] {
      const auto reports = [&] { return throwingHandler ? exceptions.Count() : recorder->Count(); };
      EXPECT_TRUE(messaging_test::WaitUntil([&] { return reports() > 0; }));
      std::this_thread::sleep_for(milliseconds(100));  // three thresholds more: still one report
      EXPECT_EQ(reports(), 1u);
      EXPECT_FALSE(removed.load()) << "the removal returned while the handler ran";
      release.CountDown();
    });
    station.BroadcastMessage(NumberMessage(7));
    releaser.join();
    remover.join();
    EXPECT_TRUE(removed.load());
    const std::string text = throwingHandler ? exceptions.Entries().at(0) : recorder->Entries().at(0).key;
    const std::size_t waited = text.find("has waited ");
    EXPECT_GE(std::atoi(text.c_str() + (waited == std::string::npos ? text.size() : waited + 11)), 30) << text;
    if (!throwingHandler) {
      EXPECT_EQ(text.rfind(Tarn::Tracing::kRemovalWaitKey, 0), 0u) << text;
      const kivcore::config::ErrorReport report = recorder->Entries().at(0);
      EXPECT_EQ(std::make_tuple(report.level, report.number, report.code, report.flag), std::make_tuple(0, 0u, 0, false));
    }
    for (const std::string& part :
         {"plain listener " + Address(&outer), std::string("\"") + station.GetStationID().c_str() + "\"",
          std::string("delivering messaging_test::NumberMessage"),
          "delivering messaging_test::PingMessage to plain listener " + Address(&stuck) + " on broadcaster " +
              Address(&nested)}) {
      EXPECT_NE(text.find(part), std::string::npos) << "no '" << part << "' in: " << text;
    }
    station.AddListener(&outer);
  }
  Tarn::Tracing::SetRemovalWaitReport(previous);
}

// Listener probes for the misuse checks: the handler blocks without touching
// the listener again, so that the test itself stays defined.
class BlockingListener : public Tarn::Listener {
public:
  BlockingListener(Latch& inEntered, Latch& inRelease) : mEntered(inEntered), mRelease(inRelease) {}
  void ListenToMessage(const Tarn::Message&) override {
    Latch& release = mRelease;
    mEntered.CountDown();
    EXPECT_TRUE(release.WaitFor());
  }

private:
  Latch& mEntered;
  Latch& mRelease;
};

TEST(Tracing, DestroyingWhatADeliveryStillUsesIsReportedInDebugBuilds) {
  messaging_test::MainThreadGuard mainThread;
  messaging_test::ContractDialogRecorder dialog;
  messaging_test::ErrorRecorder errors;
  // Shows when the worker below has started waiting in ~Listener.
  const milliseconds previous = Tarn::Tracing::SetRemovalWaitReport(milliseconds(20));
  auto* doomed = new Tarn::Broadcaster;
  RecordingListener suicide("S");
  suicide.SetAction([&](const Tarn::Message&) { delete doomed; });
  doomed->AddListener(&suicide);
  doomed->BroadcastMessage(NumberMessage(1));
  EXPECT_EQ(dialog.Count(), kDebugReports) << "a broadcaster destroyed by its own handler";

  // On a worker while the main thread delivers: the broadcaster, then a
  // listener never detached while whole.
  for (const bool destroyListener : {false, true}) {
    auto broadcaster = std::make_unique<Tarn::Broadcaster>();
    Latch entered, release, destroyed;
    auto* listener = new BlockingListener(entered, release);
    broadcaster->AddListener(listener);
    Tarn::Broadcaster* const raw = broadcaster.get();
    const std::size_t errorsBefore = errors.Count();
    std::thread worker([&] {
      EXPECT_TRUE(entered.WaitFor());
      destroyListener ? delete listener : broadcaster.reset();
      destroyed.CountDown();
    });
    std::thread releaser([&] {
      EXPECT_TRUE(destroyListener ? messaging_test::WaitUntil([&] { return errors.Count() > errorsBefore; })
                                  : destroyed.WaitFor());
      release.CountDown();
    });
    raw->BroadcastMessage(NumberMessage(2));
    releaser.join();
    worker.join();
    if (!destroyListener) delete listener;
  }
  Tarn::Tracing::SetRemovalWaitReport(previous);
  // A main-thread-only object destroyed on a worker.
  auto timer = std::make_unique<Tarn::IdleCountdownTimer>();
  std::thread([&] { timer.reset(); }).join();
  const std::vector<messaging_test::ContractViolation> violations = dialog.Entries();
  ASSERT_EQ(violations.size(), 4 * kDebugReports);
  EXPECT_EQ(errors.Count(), 1 + 4 * kDebugReports) << "the removal-wait report, and one per violation";
  const char* const expected[] = {"Tarn::Broadcaster::~Broadcaster", "Tarn::Broadcaster::~Broadcaster",
                                  "Tarn::Listener::~Listener", "Tarn::IdleCountdownTimer::~IdleCountdownTimer"};
  for (std::size_t i = 0; i < violations.size(); ++i) EXPECT_EQ(violations[i].function, expected[i]);
}

}  // namespace
