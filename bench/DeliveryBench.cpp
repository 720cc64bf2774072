// Synchronous broadcast to N listeners, on the main thread: the time of one
// delivery (one handler reached with one message), for a raw loop of virtual
// calls, boost::signals2, libsigc++ (when installed) and three ways of
// reaching Tarn listeners. Items processed are deliveries, so the reported
// rate is deliveries per second.
#include "BenchSupport.h"

#include <boost/signals2/signal.hpp>

#if defined(TARN_BENCH_HAVE_SIGC)
#include <sigc++/sigc++.h>
#endif

#include <memory>
#include <vector>

namespace TarnBench {
namespace {

constexpr int kA = 3;
constexpr int kB = 4;

// Checks that every handler was called once per broadcast, then reports the
// deliveries.
void Finish(benchmark::State& ioState, const std::vector<Tally>& inTallies) {
  const auto broadcasts = static_cast<std::int64_t>(ioState.iterations());
  if (!Verify(ioState, AllEqual(inTallies, broadcasts, broadcasts * (kA + kB)),
              "a listener was not called exactly once per broadcast"))
    return;
  ioState.SetItemsProcessed(broadcasts * static_cast<std::int64_t>(inTallies.size()));
}

void Floor(benchmark::State& ioState) {
  std::vector<Tally> tallies(static_cast<std::size_t>(ioState.range(0)));
  std::vector<std::unique_ptr<PairSink>> owners;
  std::vector<PairSink*> sinks;
  for (Tally& tally : tallies) {
    owners.emplace_back(NewTallySink(&tally));
    sinks.push_back(owners.back().get());
  }
  PairArgs args{kA, kB};
  for (auto _ : ioState) {
    benchmark::DoNotOptimize(args);
    for (PairSink* sink : sinks) sink->OnPair(args);
  }
  Finish(ioState, tallies);
}

void Signals2(benchmark::State& ioState) {
  std::vector<Tally> tallies(static_cast<std::size_t>(ioState.range(0)));
  boost::signals2::signal<void(const PairArgs&)> signal;
  for (Tally& tally : tallies) {
    Tally* target = &tally;
    signal.connect([target](const PairArgs& inArgs) { target->Add(inArgs.mA, inArgs.mB); });
  }
  PairArgs args{kA, kB};
  for (auto _ : ioState) {
    benchmark::DoNotOptimize(args);
    signal(args);
  }
  Finish(ioState, tallies);
}

#if defined(TARN_BENCH_HAVE_SIGC)
void Sigc(benchmark::State& ioState) {
  std::vector<Tally> tallies(static_cast<std::size_t>(ioState.range(0)));
  sigc::signal<void(const PairArgs&)> signal;
  for (Tally& tally : tallies) {
    Tally* target = &tally;
    signal.connect([target](const PairArgs& inArgs) { target->Add(inArgs.mA, inArgs.mB); });
  }
  PairArgs args{kA, kB};
  for (auto _ : ioState) {
    benchmark::DoNotOptimize(args);
    signal.emit(args);
  }
  Finish(ioState, tallies);
}
#endif

void TarnPlain(benchmark::State& ioState) {
  if (!VerifyMainThread(ioState)) return;
  std::vector<Tally> tallies(static_cast<std::size_t>(ioState.range(0)));
  std::vector<std::unique_ptr<TarnTallyListener>> listeners;
  Tarn::Broadcaster broadcaster;
  for (Tally& tally : tallies) {
    listeners.push_back(std::make_unique<TarnTallyListener>(&tally));
    broadcaster.AddListener(listeners.back().get());
  }
  const PairMessage message(kA, kB);
  for (auto _ : ioState) broadcaster.BroadcastMessage(message);
  Finish(ioState, tallies);
}

void TarnWeak(benchmark::State& ioState) {
  if (!VerifyMainThread(ioState)) return;
  std::vector<Tally> tallies(static_cast<std::size_t>(ioState.range(0)));
  std::vector<std::shared_ptr<TarnTallyListener>> listeners;
  Tarn::Broadcaster broadcaster;
  for (Tally& tally : tallies) {
    listeners.push_back(std::make_shared<TarnTallyListener>(&tally));
    broadcaster.AddListener(std::weak_ptr<Tarn::Listener>(listeners.back()));
  }
  const PairMessage message(kA, kB);
  for (auto _ : ioState) broadcaster.BroadcastMessage(message);
  Finish(ioState, tallies);
}

void TarnStation(benchmark::State& ioState) {
  if (!VerifyMainThread(ioState)) return;
  // A station of our own, made by the registry on first use and kept for
  // the rest of the run; the listeners detach themselves when destroyed.
  static const kivcore::utility::ImmutableString sStationID = [] {
    const auto id = kivcore::utility::ImmutableString::CreateStatic("tarn.bench.delivery");
    Tarn::StationRegistry::RegisterStation(id, nullptr);
    return id;
  }();
  std::vector<Tally> tallies(static_cast<std::size_t>(ioState.range(0)));
  std::vector<std::unique_ptr<TarnTallyListener>> listeners;
  for (Tally& tally : tallies) {
    listeners.push_back(std::make_unique<TarnTallyListener>(&tally));
    Tarn::StationUtils::AddListener(sStationID, listeners.back().get());
  }
  const PairMessage message(kA, kB);
  for (auto _ : ioState) Tarn::StationUtils::BroadcastMessage(sStationID, message);
  Finish(ioState, tallies);
}

void Register(const char* inName, void (*inFunction)(benchmark::State&)) {
  WithBestOf(benchmark::RegisterBenchmark(inName, inFunction))->Arg(1)->Arg(10)->Arg(100)->Arg(1000)->MinTime(0.1);
}

const bool sRegistered = [] {
  Register("Delivery/Floor", &Floor);
  Register("Delivery/Signals2", &Signals2);
#if defined(TARN_BENCH_HAVE_SIGC)
  Register("Delivery/Sigc", &Sigc);
#endif
  Register("Delivery/TarnPlain", &TarnPlain);
  Register("Delivery/TarnWeak", &TarnWeak);
  Register("Delivery/TarnStation", &TarnStation);
  return true;
}();

}  // namespace
}  // namespace TarnBench
