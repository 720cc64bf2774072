// Shared pieces of the event-loop integration tests: a numbered message, the
// loops driven the same way (Asio and, where built, GLib and Qt), and polling
// a loop until a condition holds or the deadline passes.
//
// Threading: everything here is for the main thread, except posting.
#pragma once

#include <TarnMessaging.h>
#include <TarnMessaging/Integration/AsioEventLoop.h>
#if TARN_HAVE_GLIB_INTEGRATION
#include <TarnMessaging/Integration/GLibEventLoop.h>
#endif
#if TARN_HAVE_QT_INTEGRATION
#include <TarnMessaging/Integration/QtEventLoop.h>
#endif

#include "BoundedWait.h"

#include <boost/asio/io_context.hpp>

#include <memory>
#include <tuple>

namespace integration_test {

// Producer inProducer's message number inSequence. A queued copy knows
// whether it was heard, so that one destroyed unheard can report a drop.
struct Numbered : Tarn::MessageImpl<Numbered> {
  Numbered(int inProducer, int inSequence) : mProducer(inProducer), mSequence(inSequence) {}
  Numbered(const Numbered& inOther) : MessageImpl(inOther), mProducer(inOther.mProducer), mSequence(inOther.mSequence), mIsCopy(true) {}
  ~Numbered() override;
  int mProducer;
  int mSequence;
  bool mIsCopy = false;
  mutable bool mHeard = false;
};

// Called on the destroying thread for each queued copy destroyed unheard.
inline void (*gOnUnheardCopy)(const Numbered&) = nullptr;
inline Numbered::~Numbered() {
  if (mIsCopy && !mHeard && gOnUnheardCopy != nullptr) gOnUnheardCopy(*this);
}

// Idle checks every millisecond, so that idle broadcasts mix with whatever a
// test does.
template <class Integration>
std::unique_ptr<Integration> QuickIdle(std::unique_ptr<Integration> inIntegration) {
  inIntegration->SetIdleInterval(std::chrono::milliseconds(1));
  return inIntegration;
}

struct AsioLoop {
  using Integration = Tarn::Integration::AsioEventLoop;
  boost::asio::io_context mContext;
  std::unique_ptr<Integration> Make() { return std::make_unique<Integration>(mContext); }
  void Poll() {
    mContext.restart();
    mContext.poll();
  }
};

#if TARN_HAVE_GLIB_INTEGRATION
struct GLibLoop {
  using Integration = Tarn::Integration::GLibEventLoop;
  GMainContext* mContext = g_main_context_new();
  ~GLibLoop() { g_main_context_unref(mContext); }
  std::unique_ptr<Integration> Make() { return std::make_unique<Integration>(mContext); }
  void Poll() {
    while (g_main_context_iteration(mContext, FALSE)) {
    }
  }
};
#endif

#if TARN_HAVE_QT_INTEGRATION
// The process has one QCoreApplication, made by the first QtLoop on the test
// thread, which is the main thread of every test.
struct QtLoop {
  using Integration = Tarn::Integration::QtEventLoop;
  QtLoop() {
    static int argc = 1;
    static char* argv[] = {const_cast<char*>("integration_tests"), nullptr};
    static QCoreApplication application(argc, argv);
  }
  std::unique_ptr<Integration> Make() { return std::make_unique<Integration>(); }
  void Poll() { QCoreApplication::processEvents(); }
};
#endif

// Every loop built here, for a typed suite (TypesOf) or one of each kind
// (TupleOf).
template <class... Loop>
struct LoopList {};
template <class... Loop>
::testing::Types<Loop...> TypesOf(LoopList<Loop...>);
template <class... Loop>
std::tuple<Loop...> TupleOf(LoopList<Loop...>);
using AllLoops = LoopList<AsioLoop
#if TARN_HAVE_GLIB_INTEGRATION
                          , GLibLoop
#endif
#if TARN_HAVE_QT_INTEGRATION
                          , QtLoop
#endif
                          >;

// Polls inLoop until inDone() or inTimeout passes; returns inDone().
template <class Loop, class Predicate>
bool PollUntil(Loop& inLoop, Predicate inDone, std::chrono::milliseconds inTimeout = tarn_test::kDeadline) {
  auto pollThenCheck = [&] { return inLoop.Poll(), inDone(); };
  return tarn_test::WaitUntil(pollThenCheck, inTimeout);
}

}  // namespace integration_test
