// The synchronous scenarios, run alike for every peer on the main thread:
//   Delivery/<peer>/N      one broadcast to N handlers; items are deliveries,
//                          so the rate is deliveries per second
//   Attach/<peer>/N        one handler attached and detached again while N
//                          others stay attached; items are pairs
//   DetachOldest/<peer>/N  N handlers attached, then detached oldest first;
//                          items are detaches, timed alone
//   Alloc/Delivery/<peer>  general-heap and small-block allocations per
//                          delivery (1,000 broadcasts to 100 handlers after
//                          a warm-up broadcast)
//   Alloc/Listener/<peer>  bytes and allocations per registered handler
//                          (1,000 attached to one sender)
// After each run a broadcast or the tallies prove that every handler was
// called exactly as often as it had to be, and a detached one never.
//
// A peer is a sender with four operations: Make(tally) makes a handler
// outside any timing, Connect and Disconnect attach and detach it, Emit
// delivers the pair to every attached handler.
#include "BenchSupport.h"

#include <kivcore/RecursiveMutex.h>

#include <boost/signals2/signal.hpp>

#if defined(TARN_BENCH_HAVE_SIGC)
#include <sigc++/sigc++.h>
#endif
#if defined(TARN_BENCH_HAVE_QT)
#include "QtPeers.h"
#endif

#include <memory>
#include <string>
#include <vector>

namespace TarnBench {
namespace {

constexpr int kAllocListeners = 100;
constexpr int kAllocBroadcasts = 1000;
constexpr int kRegisteredListeners = 1000;

struct Floor {
  using Handler = std::unique_ptr<PairSink>;
  Handler Make(Tally* inTally) { return Handler(NewTallySink(inTally)); }
  void Connect(Handler& inHandler) { mSinks.push_back(inHandler.get()); }
  void Emit() {
    for (PairSink* sink : mSinks) sink->OnPair(PairArgs{kA, kB});
  }
  std::vector<PairSink*> mSinks;
};

// The floor of a walk that holds a lock once per step, as Tarn's does: the
// same loop, with one lock and unlock of kivcore's mutex around the pick of
// each handler and one more to find the end.
struct LockedFloor : Floor {
  void Emit() {
    for (std::size_t i = 0;; ++i) {
      mMutex.Lock(nullptr);
      PairSink* const sink = i < mSinks.size() ? mSinks[i] : nullptr;
      mMutex.Unlock();
      if (sink == nullptr) return;
      sink->OnPair(PairArgs{kA, kB});
    }
  }
  kivcore::threads::RecursiveMutex mMutex;
};

// A slot library's handler: a lambda over the tally, and its connection.
template <class Connection>
struct Slot {
  Tally* mTally;
  Connection mConnection;
  auto Function() const {
    return [tally = mTally](const PairArgs& inArgs) { tally->Add(inArgs.mA, inArgs.mB); };
  }
};

struct Signals2 {
  using Handler = Slot<boost::signals2::connection>;
  Handler Make(Tally* inTally) { return {inTally, {}}; }
  void Connect(Handler& ioHandler) { ioHandler.mConnection = mSignal.connect(ioHandler.Function()); }
  void Disconnect(Handler& ioHandler) { ioHandler.mConnection.disconnect(); }
  void Emit() { mSignal(PairArgs{kA, kB}); }
  boost::signals2::signal<void(const PairArgs&)> mSignal;
};

#if defined(TARN_BENCH_HAVE_SIGC)
struct Sigc {
  using Handler = Slot<sigc::connection>;
  Handler Make(Tally* inTally) { return {inTally, {}}; }
  void Connect(Handler& ioHandler) { ioHandler.mConnection = mSignal.connect(ioHandler.Function()); }
  void Disconnect(Handler& ioHandler) { ioHandler.mConnection.disconnect(); }
  void Emit() { mSignal.emit(PairArgs{kA, kB}); }
  sigc::signal<void(const PairArgs&)> mSignal;
};
#endif

#if defined(TARN_BENCH_HAVE_QT)
// A direct connection to a functor.
struct QtFunctor {
  using Handler = Slot<QMetaObject::Connection>;
  Handler Make(Tally* inTally) { return {inTally, {}}; }
  void Connect(Handler& ioHandler) {
    ioHandler.mConnection = QObject::connect(&mSender, &QtSender::Pair, ioHandler.Function());
  }
  void Disconnect(Handler& ioHandler) { QObject::disconnect(ioHandler.mConnection); }
  void Emit() { Q_EMIT mSender.Pair(PairArgs{kA, kB}); }
  QtSender mSender;
};

// A direct connection to a receiver's slot.
struct QtSlot : QtFunctor {
  struct Handler {
    std::unique_ptr<QtReceiver> mReceiver;
    QMetaObject::Connection mConnection;
  };
  Handler Make(Tally* inTally) { return {std::make_unique<QtReceiver>(inTally), {}}; }
  void Connect(Handler& ioHandler) {
    ioHandler.mConnection = QObject::connect(&mSender, &QtSender::Pair, ioHandler.mReceiver.get(), &QtReceiver::OnPair,
                                             Qt::DirectConnection);
  }
  void Disconnect(Handler& ioHandler) { QObject::disconnect(ioHandler.mConnection); }
};
#endif

struct TarnPlain {
  using Handler = std::unique_ptr<TarnTallyListener>;
  Handler Make(Tally* inTally) { return std::make_unique<TarnTallyListener>(inTally); }
  void Connect(Handler& inHandler) { mBroadcaster.AddListener(inHandler.get()); }
  void Disconnect(Handler& inHandler) { mBroadcaster.RemoveListener(inHandler.get(), true); }
  void Emit() { mBroadcaster.BroadcastMessage(mMessage); }
  Tarn::Broadcaster mBroadcaster;
  const PairMessage mMessage{kA, kB};
};

struct TarnWeak : TarnPlain {
  using Handler = std::shared_ptr<TarnTallyListener>;
  Handler Make(Tally* inTally) { return std::make_shared<TarnTallyListener>(inTally); }
  void Connect(Handler& inHandler) { mBroadcaster.AddListener(std::weak_ptr<Tarn::Listener>(inHandler)); }
};

// The same broadcast made by station ID, through the registry.
struct TarnStation : TarnPlain {
  void Connect(Handler& inHandler) { Tarn::StationUtils::AddListener(BenchStationID(), inHandler.get()); }
  void Emit() { Tarn::StationUtils::BroadcastMessage(BenchStationID(), mMessage); }
};

// A typed subscription per handler on the same broadcaster: a lambda where
// TarnPlain has a listener class that compares the message ID itself.
struct TarnTyped : TarnPlain {
  struct Handler {
    Tally* mTally;
    Tarn::Registration mRegistration;
  };
  Handler Make(Tally* inTally) { return {inTally, {}}; }
  void Connect(Handler& ioHandler) {
    ioHandler.mRegistration = Tarn::Subscribe<PairMessage>(
        mBroadcaster, [tally = ioHandler.mTally](const PairMessage& inPair) { tally->Add(inPair.mA, inPair.mB); });
  }
  void Disconnect(Handler& ioHandler) { ioHandler.mRegistration.Reset(); }
};

// A peer with inCount handlers, connected unless told otherwise. Handlers die
// before the sender; every peer detaches a handler that dies.
template <class Peer>
struct Rig {
  explicit Rig(std::size_t inCount, bool inConnect = true) : mTallies(inCount) {
    mHandlers.reserve(inCount);
    for (Tally& tally : mTallies) {
      mHandlers.push_back(mPeer.Make(&tally));
      if (inConnect) mPeer.Connect(mHandlers.back());
    }
  }
  Peer mPeer;
  std::vector<Tally> mTallies;
  std::vector<typename Peer::Handler> mHandlers;
};

template <class Peer>
void Delivery(benchmark::State& ioState) {
  if (!VerifyMainThread(ioState)) return;
  Rig<Peer> rig(static_cast<std::size_t>(ioState.range(0)));
  for (auto _ : ioState) rig.mPeer.Emit();
  const auto broadcasts = static_cast<std::int64_t>(ioState.iterations());
  if (Verify(ioState, AllCalled(rig.mTallies, broadcasts), "a handler was not called exactly once per broadcast"))
    ioState.SetItemsProcessed(broadcasts * ioState.range(0));
}

template <class Peer>
void Attach(benchmark::State& ioState) {
  if (!VerifyMainThread(ioState)) return;
  Rig<Peer> rig(static_cast<std::size_t>(ioState.range(0)));
  Rig<Peer> extra(1, false);
  auto& handler = extra.mHandlers[0];
  for (auto _ : ioState) {
    rig.mPeer.Connect(handler);
    rig.mPeer.Disconnect(handler);
  }
  rig.mPeer.Emit();
  if (Verify(ioState, AllCalled(rig.mTallies, 1) && AllCalled(extra.mTallies, 0),
             "after attach+detach pairs, a broadcast missed an attached handler or reached the detached one"))
    ioState.SetItemsProcessed(static_cast<std::int64_t>(ioState.iterations()));
}

template <class Peer>
void DetachOldest(benchmark::State& ioState) {
  if (!VerifyMainThread(ioState)) return;
  const auto count = static_cast<std::size_t>(ioState.range(0));
  bool silent = true;
  for (auto _ : ioState) {
    ioState.PauseTiming();
    {
      Rig<Peer> rig(count);
      ioState.ResumeTiming();
      for (auto& handler : rig.mHandlers) rig.mPeer.Disconnect(handler);
      ioState.PauseTiming();
      rig.mPeer.Emit();
      silent = silent && AllCalled(rig.mTallies, 0);
    }
    ioState.ResumeTiming();
  }
  if (Verify(ioState, silent, "a broadcast after the detaches reached a detached handler"))
    ioState.SetItemsProcessed(static_cast<std::int64_t>(ioState.iterations() * count));
}

template <class Peer>
void AllocDelivery(benchmark::State& ioState) {
  if (!VerifyMainThread(ioState)) return;
  Rig<Peer> rig(kAllocListeners);
  for (auto _ : ioState) {
    rig.mPeer.Emit();  // first-use allocations are not per delivery
    AllocationCounts counts;
    for (int i = 0; i < kAllocBroadcasts; ++i) rig.mPeer.Emit();
    const double heap = static_cast<double>(counts.HeapAllocations());
    const double small = static_cast<double>(counts.SmallBlocks());
    if (!Verify(ioState, AllCalled(rig.mTallies, kAllocBroadcasts + 1), "a handler was not called once per broadcast"))
      return;
    ioState.counters["heap_allocs_per_op"] = heap / (kAllocBroadcasts * kAllocListeners);
    ioState.counters["small_blocks_per_op"] = small / (kAllocBroadcasts * kAllocListeners);
  }
}

template <class Peer>
void AllocListener(benchmark::State& ioState) {
  if (!VerifyMainThread(ioState)) return;
  for (auto _ : ioState) {
    Rig<Peer> rig(kRegisteredListeners, false);
    double small, heapBytes, heap;
    {
      AllocationCounts counts;
      for (auto& handler : rig.mHandlers) rig.mPeer.Connect(handler);
      small = static_cast<double>(counts.SmallBytes());
      heapBytes = static_cast<double>(counts.HeapBytes());
      heap = static_cast<double>(counts.HeapAllocations());
    }
    rig.mPeer.Emit();
    if (!Verify(ioState, AllCalled(rig.mTallies, 1), "a registered handler was not called once")) return;
    ioState.counters["small_block_bytes_per_listener"] = small / kRegisteredListeners;
    ioState.counters["heap_bytes_per_listener"] = heapBytes / kRegisteredListeners;
    ioState.counters["heap_allocs_per_listener"] = heap / kRegisteredListeners;
  }
}

// Delivery for every peer; attach+detach and the allocation counts where asked.
template <class Peer, bool kWithAttach = true, bool kWithAllocs = true>
void Register(const std::string& inName) {
  WithBestOf(benchmark::RegisterBenchmark(("Delivery/" + inName).c_str(), &Delivery<Peer>))
      ->Arg(1)
      ->Arg(10)
      ->Arg(100)
      ->Arg(1000)
      ->MinTime(0.1);
  if constexpr (kWithAttach)
    WithBestOf(benchmark::RegisterBenchmark(("Attach/" + inName).c_str(), &Attach<Peer>))
        ->Arg(10)
        ->Arg(1000)
        ->MinTime(0.1);
  if constexpr (kWithAttach)
    benchmark::RegisterBenchmark(("DetachOldest/" + inName).c_str(), &DetachOldest<Peer>)
        ->Arg(1000)
        ->Arg(10000)
        ->Arg(100000)
        ->Iterations(1);
  if constexpr (kWithAllocs) {
    benchmark::RegisterBenchmark(("Alloc/Delivery/" + inName).c_str(), &AllocDelivery<Peer>)
        ->Iterations(1)
        ->Repetitions(1);
    benchmark::RegisterBenchmark(("Alloc/Listener/" + inName).c_str(), &AllocListener<Peer>)
        ->Iterations(1)
        ->Repetitions(1);
  }
}

const bool sRegistered = [] {
  Register<Floor, false, false>("Floor");
  Register<LockedFloor, false, false>("LockedFloor");
  Register<Signals2>("Signals2");
#if defined(TARN_BENCH_HAVE_SIGC)
  Register<Sigc>("Sigc");
#endif
#if defined(TARN_BENCH_HAVE_QT)
  Register<QtFunctor>("QtFunctor");
  Register<QtSlot, true, false>("QtSlot");
#endif
  Register<TarnPlain>("TarnPlain");
  Register<TarnTyped>("TarnTyped");
  Register<TarnWeak, false>("TarnWeak");
  Register<TarnStation, false>("TarnStation");
  return true;
}();

}  // namespace
}  // namespace TarnBench
