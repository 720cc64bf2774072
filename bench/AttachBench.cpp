// Attaching and detaching one listener while N others stay attached: the
// time of one attach+detach pair, Tarn's Broadcaster (plain pointer) against
// boost::signals2 connect/disconnect (and libsigc++ when installed). After
// the run one broadcast proves that the N stayed attached, each called once,
// and that the extra listener is gone.
#include "BenchSupport.h"

#include <boost/signals2/signal.hpp>

#if defined(TARN_BENCH_HAVE_SIGC)
#include <sigc++/sigc++.h>
#endif

#include <memory>
#include <vector>

namespace TarnBench {
namespace {

constexpr int kA = 5;
constexpr int kB = 6;

void Finish(benchmark::State& ioState, const std::vector<Tally>& inTallies, const Tally& inExtra) {
  if (!Verify(ioState, AllEqual(inTallies, 1, kA + kB), "a remaining listener was not called exactly once")) return;
  if (!Verify(ioState, inExtra.mCalls == 0, "the detached listener was called")) return;
  ioState.SetItemsProcessed(static_cast<std::int64_t>(ioState.iterations()));
}

void TarnPlain(benchmark::State& ioState) {
  if (!VerifyMainThread(ioState)) return;
  std::vector<Tally> tallies(static_cast<std::size_t>(ioState.range(0)));
  std::vector<std::unique_ptr<TarnTallyListener>> listeners;
  Tarn::Broadcaster broadcaster;
  for (Tally& tally : tallies) {
    listeners.push_back(std::make_unique<TarnTallyListener>(&tally));
    broadcaster.AddListener(listeners.back().get());
  }
  Tally extraTally;
  TarnTallyListener extra(&extraTally);
  for (auto _ : ioState) {
    broadcaster.AddListener(&extra);
    broadcaster.RemoveListener(&extra, true);
  }
  if (!Verify(ioState, !broadcaster.HasListener(&extra) && !extra.HasBroadcaster(&broadcaster),
              "the extra listener is still registered"))
    return;
  broadcaster.BroadcastMessage(PairMessage(kA, kB));
  Finish(ioState, tallies, extraTally);
}

void Signals2(benchmark::State& ioState) {
  std::vector<Tally> tallies(static_cast<std::size_t>(ioState.range(0)));
  boost::signals2::signal<void(const PairArgs&)> signal;
  for (Tally& tally : tallies) {
    Tally* target = &tally;
    signal.connect([target](const PairArgs& inArgs) { target->Add(inArgs.mA, inArgs.mB); });
  }
  Tally extraTally;
  Tally* extra = &extraTally;
  for (auto _ : ioState) {
    boost::signals2::connection connection =
        signal.connect([extra](const PairArgs& inArgs) { extra->Add(inArgs.mA, inArgs.mB); });
    connection.disconnect();
  }
  if (!Verify(ioState, signal.num_slots() == tallies.size(), "the extra slot is still connected")) return;
  signal(PairArgs{kA, kB});
  Finish(ioState, tallies, extraTally);
}

#if defined(TARN_BENCH_HAVE_SIGC)
void Sigc(benchmark::State& ioState) {
  std::vector<Tally> tallies(static_cast<std::size_t>(ioState.range(0)));
  sigc::signal<void(const PairArgs&)> signal;
  for (Tally& tally : tallies) {
    Tally* target = &tally;
    signal.connect([target](const PairArgs& inArgs) { target->Add(inArgs.mA, inArgs.mB); });
  }
  Tally extraTally;
  Tally* extra = &extraTally;
  for (auto _ : ioState) {
    sigc::connection connection = signal.connect([extra](const PairArgs& inArgs) { extra->Add(inArgs.mA, inArgs.mB); });
    connection.disconnect();
  }
  if (!Verify(ioState, signal.size() == tallies.size(), "the extra slot is still connected")) return;
  signal.emit(PairArgs{kA, kB});
  Finish(ioState, tallies, extraTally);
}
#endif

void Register(const char* inName, void (*inFunction)(benchmark::State&)) {
  WithBestOf(benchmark::RegisterBenchmark(inName, inFunction))->Arg(10)->Arg(1000)->MinTime(0.1);
}

const bool sRegistered = [] {
  Register("Attach/Signals2", &Signals2);
#if defined(TARN_BENCH_HAVE_SIGC)
  Register("Attach/Sigc", &Sigc);
#endif
  Register("Attach/TarnPlain", &TarnPlain);
  return true;
}();

}  // namespace
}  // namespace TarnBench
