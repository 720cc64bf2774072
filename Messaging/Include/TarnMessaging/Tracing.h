/// @file
/// Tarn::Tracing: seeing what deliveries cost and where a removal hangs.
///
/// A delivery tracer is one process-wide object, off by default, that hears
/// about every delivery a broadcast makes: on which broadcaster or station,
/// of which message type, to which listener, on which thread and for how
/// long. A removal-wait report tells, once, about a removal that has waited
/// longer than a threshold for a delivery running on the main thread.
///
/// @code{.cpp}
///   class SlowHandlers : public Tarn::Tracing::DeliveryTracer {
///     void DeliveryEnded(const Tarn::Tracing::Delivery& inDelivery, std::chrono::nanoseconds inTook) override {
///       if (inTook > std::chrono::milliseconds(5)) Note(inDelivery.mStationID, inDelivery.mListener, inTook);
///     }
///   } slow;
///   Tarn::Tracing::SetDeliveryTracer(&slow);      // on the main thread
///   ...
///   Tarn::Tracing::SetDeliveryTracer(nullptr);    // ditto; slow is not called again
///   Tarn::Tracing::SetRemovalWaitReport(std::chrono::milliseconds(500));
/// @endcode
///
/// Cost: with no tracer installed and no removal-wait report set, a
/// broadcast reads one flag (a relaxed atomic load) when it starts and does
/// nothing else for tracing. Otherwise each delivery reads the clock twice and
/// takes a short process-wide lock twice (the record of the main thread's
/// current delivery that a removal-wait report names).
///
/// Threading: the tracer is called on the broadcasting thread (the main
/// thread), with no lock of the library held, right before and right after
/// each delivery, also one that threw. A broadcast reads the tracer once, when
/// it starts, and calls that tracer for all its deliveries: a tracer replaced
/// on another thread, or by a handler, may still be called by broadcasts that
/// were running then. Replaced on the main thread outside every broadcast, it
/// is not called again once SetDeliveryTracer returns, and may be destroyed.
/// A tracer may broadcast; the deliveries of broadcasts made from inside the
/// tracer are not traced, so it cannot recurse into itself. An exception a
/// tracer throws goes to the error manager's GuardedCall, as a handler's
/// would; a throw from DeliveryBegins does not skip the delivery (the
/// exception goes to the error manager after it).
///
/// Removal-wait report: a removal (RemoveListener, a listener's destructor,
/// a registration's destruction) made on one thread while another thread (the
/// main thread) delivers to that listener waits for the delivery to return.
/// Once it has waited longer than the threshold, it reports once through
/// kivcore's ThrowError, with the key kRemovalWaitKey followed by a text that
/// names the listener, the broadcaster or station, the time waited and the
/// main thread's current delivery, and then goes on waiting: a handler may
/// legitimately be slow. The report runs inside the error manager's
/// GuardedCall, so an error handler that throws (the default one does) only
/// hands its exception to the exception handler; the removal still returns
/// only once the delivery has returned. Debug builds report after
/// kDefaultRemovalWaitReport; release builds do not report unless set. The
/// main thread's current delivery is known only for broadcasts that started
/// while a tracer or the report was on; otherwise the report says so.
#pragma once

#include <TarnMessaging/Export.h>
#include <TarnMessaging/Message.h>

#include <kivcore/ImmutableString.h>

#include <chrono>
#include <string>
#include <thread>

namespace Tarn {

class Broadcaster;

namespace Tracing {

/// How a broadcaster holds the listener of a delivery.
enum class ListenerKind { kPlain, kSafe, kBoostWeak, kStdWeak };

/// One delivery as the tracer sees it. Valid for the duration of the call;
/// copy what you keep (mMessageType is a static string and may be kept while
/// the message's module is loaded).
struct Delivery {
  const Broadcaster* mBroadcaster = nullptr;     ///< compare only: it may be gone once the call returns
  kivcore::utility::ImmutableString mStationID;  ///< the station's ID; empty for a bare broadcaster
  MessageID mMessageID = 0;                      ///< the message's type ID
  const char* mMessageType = "";                 ///< the type's decorated name (ReadableTypeName turns it into C++)
  const void* mListener = nullptr;  ///< the Listener, or the safe listener's object; null when a weak one was gone
  ListenerKind mListenerKind = ListenerKind::kPlain;  ///< how the broadcaster holds it
  std::thread::id mThread;                             ///< the broadcasting thread
};

/// Hears every delivery of every broadcast while installed. Not owned by the
/// library; see the threading paragraph above for when it may be destroyed.
class TARN_MESSAGING_API DeliveryTracer {
public:
  /// Right before the listener is called. The default does nothing.
  virtual void DeliveryBegins(const Delivery& inDelivery);
  /// Right after the listener returned (or threw, or was found gone), with
  /// the time the delivery took on a steady clock.
  virtual void DeliveryEnded(const Delivery& inDelivery, std::chrono::nanoseconds inDuration) = 0;

protected:
  ~DeliveryTracer() = default;
};

/// Installs inTracer (null: none) for every broadcast that starts from now
/// on, and returns the tracer installed before. Any thread.
TARN_MESSAGING_API DeliveryTracer* SetDeliveryTracer(DeliveryTracer* inTracer) noexcept;

/// The threshold of the removal-wait report in debug builds, unless set.
constexpr std::chrono::milliseconds kDefaultRemovalWaitReport{2000};

/// The key of the removal-wait report; the text follows the '='.
constexpr const char* kRemovalWaitKey = "$$$/TarnMessaging/Tracing/RemovalWait=";

/// Sets how long a removal waits for a delivery on another thread before it
/// reports (zero or less: never), for removals that start waiting from now
/// on, and returns the previous threshold. Any thread.
TARN_MESSAGING_API std::chrono::milliseconds SetRemovalWaitReport(std::chrono::milliseconds inThreshold) noexcept;

/// A decorated type name (Delivery::mMessageType) as C++ spells it, or the
/// name itself when it cannot be read. inDecoratedName != NULL.
TARN_MESSAGING_API std::string ReadableTypeName(const char* inDecoratedName);

}  // namespace Tracing
}  // namespace Tarn
