/// @file
/// Tarn::Subscribe and Tarn::Registration: typed handlers without a listener
/// class of their own, and registrations that detach when they go out of scope.
///
/// @code{.cpp}
///   Tarn::Registration progress = Tarn::Subscribe<Progress>(kStation_StatusBar,
///       [&](const Progress& inProgress) { bar.Show(inProgress.mDone, inProgress.mTotal); });
///   Tarn::Registration saved = Tarn::Subscribe<Saved>(document, &window, &Window::OnSaved);
///   Tarn::Registration log = Tarn::Attach(broadcaster, std::weak_ptr<Tarn::Listener>(logger));
///   // each detaches when it is destroyed; Release() keeps it attached for good
/// @endcode
///
/// Subscribe<T> makes a listener that calls the handler for messages of type T
/// only (one ID compare, then a direct call; nothing is allocated per
/// delivery) and attaches it by plain pointer to a broadcaster, or to the
/// station registered under an ID. Attach registers a listener the caller
/// holds, in any of the four ways a broadcaster holds one. Both return a
/// Registration, which detaches on destruction or Reset().
///
/// Threading: a Registration is a value: one object is used by one thread at
/// a time, but it may be moved to, and destroyed on, any thread. Its
/// destruction follows Broadcaster::RemoveListener: off the main thread it
/// returns only once a delivery to its listener running on the main thread
/// has returned, and the handler is never called after it returns. On the
/// main thread it never waits; a subscription destroyed from inside its own
/// handler is detached at once and its handler freed when that handler
/// returns. Handlers run on the main thread, as every delivery does.
///
/// Ownership: a subscription's listener (with the handler and what it
/// captures) is owned by its Registration. Attach owns nothing: a listener
/// registered by plain pointer must outlive the registration or be reset
/// first, as for RemoveListener; weak and safe listeners may die at any time.
/// The broadcaster or the station may be destroyed before the registration:
/// the registration then finds it gone and does nothing. Release() gives the
/// registration up without detaching; a released subscription's listener then
/// lives, attached, until the process ends.
///
/// A broadcaster holds a listener once, however often it is attached: of two
/// registrations of the same listener on one broadcaster, the first destroyed
/// detaches it.
///
/// Misuse (a null or expired listener) is reported by the broadcaster's
/// contract check; when the report returns, the result is an empty
/// registration. A station ID that is not registered also gives an empty one.
#pragma once

#include <TarnMessaging/Broadcaster.h>
#include <TarnMessaging/Export.h>
#include <TarnMessaging/Listener.h>
#include <TarnMessaging/Message.h>
#include <TarnMessaging/SafeListener.h>

#include <kivcore/ImmutableString.h>

#include <boost/weak_ptr.hpp>

#include <functional>
#include <memory>
#include <type_traits>
#include <utility>

namespace Tarn {

namespace SubscriptionDetail {
class OwnedListener;
}

/// A registration that detaches on destruction. Movable, not copyable; an
/// empty (default-constructed, moved-from, reset or released) one does nothing.
class TARN_MESSAGING_API Registration {
public:
  Registration() noexcept = default;
  /// Takes over ioOther's registration; ioOther is left empty.
  Registration(Registration&& ioOther) noexcept
      : mRecord(std::exchange(ioOther.mRecord, nullptr)), mOwned(std::exchange(ioOther.mOwned, nullptr)) {}
  /// Detaches what this registration held, then takes over ioOther's.
  Registration& operator=(Registration&& ioOther) noexcept;
  Registration(const Registration&) = delete;
  Registration& operator=(const Registration&) = delete;
  /// Reset().
  ~Registration() { Reset(); }

  /// Detaches now, with RemoveListener's waiting rule; then empty.
  void Reset() noexcept;
  /// Gives the registration up: nothing is detached; then empty.
  void Release() noexcept;
  /// Whether this registration still holds something to detach.
  explicit operator bool() const noexcept { return mRecord != nullptr || mOwned != nullptr; }

  /// Attaches inListener (which the subscription templates made with new) to
  /// inBroadcaster, or to the station inStationID, and owns it from then on.
  /// For Subscribe; an empty result when the station is not registered.
  /// @{
  static Registration Own(Broadcaster& ioBroadcaster, SubscriptionDetail::OwnedListener* inListener);
  static Registration Own(const kivcore::utility::ImmutableString& inStationID,
                          SubscriptionDetail::OwnedListener* inListener);
  /// @}

private:
  struct Record;
  friend struct RegistrationFactory;  // the attach helpers, in the library
  explicit Registration(Record* inRecord) noexcept : mRecord(inRecord) {}
  explicit Registration(SubscriptionDetail::OwnedListener* inOwned) noexcept : mOwned(inOwned) {}
  TARN_MESSAGING_LOCAL static std::weak_ptr<BroadcasterCore> CoreOf(const Broadcaster& inBroadcaster);

  // At most one is set, and owned: an entry to remove from a broadcaster,
  // or a subscription's listener.
  Record* mRecord = nullptr;
  SubscriptionDetail::OwnedListener* mOwned = nullptr;
};

/// Registers inListener on ioBroadcaster as Broadcaster::AddListener does and
/// returns the registration that removes it again.
/// Preconditions: inListener != NULL; for weak pointers inListener.lock() != NULL.
/// @{
[[nodiscard]] TARN_MESSAGING_API Registration Attach(Broadcaster& ioBroadcaster, Listener* inListener);
[[nodiscard]] TARN_MESSAGING_API Registration Attach(Broadcaster& ioBroadcaster,
                                                     const boost::weak_ptr<Listener>& inListener);
[[nodiscard]] TARN_MESSAGING_API Registration Attach(Broadcaster& ioBroadcaster,
                                                     const std::weak_ptr<Listener>& inListener);
[[nodiscard]] TARN_MESSAGING_API Registration Attach(Broadcaster& ioBroadcaster, const ISafeListenerRef& inListener);
/// @}

/// The same on the station registered under inStationID; empty when none is.
/// @{
[[nodiscard]] TARN_MESSAGING_API Registration Attach(const kivcore::utility::ImmutableString& inStationID,
                                                     Listener* inListener);
[[nodiscard]] TARN_MESSAGING_API Registration Attach(const kivcore::utility::ImmutableString& inStationID,
                                                     const boost::weak_ptr<Listener>& inListener);
[[nodiscard]] TARN_MESSAGING_API Registration Attach(const kivcore::utility::ImmutableString& inStationID,
                                                     const std::weak_ptr<Listener>& inListener);
[[nodiscard]] TARN_MESSAGING_API Registration Attach(const kivcore::utility::ImmutableString& inStationID,
                                                     const ISafeListenerRef& inListener);
/// @}

namespace SubscriptionDetail {

/// The part of a subscription's listener that does not depend on its type.
/// Deleted only through Dispose.
class TARN_MESSAGING_API OwnedListener : public Listener {
public:
  OwnedListener(const OwnedListener&) = delete;
  OwnedListener& operator=(const OwnedListener&) = delete;

  /// Detaches (waiting off the main thread as RemoveListener does), then
  /// deletes this listener, or, when called from inside its own handler
  /// (the main thread's, or one that made the last Terminate), deletes it as
  /// that handler returns.
  void Dispose() noexcept;

protected:
  OwnedListener() noexcept = default;
  ~OwnedListener() override;

  /// Marks one handler call for Dispose.
  class Delivery {
  public:
    /// Counts one handler call on ioListener until the scope ends.
    explicit Delivery(OwnedListener& ioListener) noexcept : mListener(ioListener) { ++mListener.mDepth; }
    ~Delivery() {
      if (--mListener.mDepth == 0 && mListener.mDisposed) delete &mListener;
    }
    Delivery(const Delivery&) = delete;
    Delivery& operator=(const Delivery&) = delete;

  private:
    OwnedListener& mListener;
  };

private:
  int mDepth = 0;          // handler calls running; on the delivering thread
  bool mDisposed = false;  // Dispose ran inside a handler call, on its thread
};

/// A subscription's listener: calls mHandler for messages of type T only.
template <class T, class Handler>
class TypedListener final : public OwnedListener {
public:
  /// Keeps inHandler (moved or copied) for the listener's lifetime.
  /// @{
  explicit TypedListener(Handler&& inHandler) : mHandler(std::move(inHandler)) {}
  explicit TypedListener(const Handler& inHandler) : mHandler(inHandler) {}
  /// @}
  // Detached while whole: the handler may be running on the main thread.
  ~TypedListener() override { DetachFromBroadcasters(); }

  void ListenToMessage(const Message& inMessage) override { Deliver(inMessage); }

protected:
  // Overridden as well, so that a delivery costs one virtual call.
  void DispatchMessage(const Message& inMessage) override { Deliver(inMessage); }

private:
  void Deliver(const Message& inMessage) {
    if (inMessage.GetMessageID() != T::StaticMessageID()) return;
    Delivery scope(*this);
    mHandler(static_cast<const T&>(inMessage));
  }

  Handler mHandler;
};

/// A new listener that calls inHandler for messages of type T; owned by the
/// caller until it is handed to a Registration.
template <class T, class Handler>
OwnedListener* NewTypedListener(Handler&& inHandler) {
  static_assert(std::is_base_of<Message, T>::value, "Subscribe<T>: T must be a message type (MessageImpl<T>)");
  using Stored = std::decay_t<Handler>;
  static_assert(std::is_invocable<Stored&, const T&>::value, "Subscribe<T>: the handler must accept const T&");
  return new TypedListener<T, Stored>(std::forward<Handler>(inHandler));
}

/// A handler that calls inMethod on inObject (not owned) with the message.
template <class T, class Object, class Method>
auto BindMember(Object* inObject, Method inMethod) {
  return [inObject, inMethod](const T& inMessage) { std::invoke(inMethod, inObject, inMessage); };
}

}  // namespace SubscriptionDetail

/// Calls inHandler(const T&) on the main thread for every message of type T
/// broadcast on ioBroadcaster, until the registration is destroyed. Throws
/// std::bad_alloc when memory is out (nothing is attached then).
template <class T, class Handler>
[[nodiscard]] Registration Subscribe(Broadcaster& ioBroadcaster, Handler&& inHandler) {
  return Registration::Own(ioBroadcaster, SubscriptionDetail::NewTypedListener<T>(std::forward<Handler>(inHandler)));
}

/// The same on the station registered under inStationID; empty when none is.
template <class T, class Handler>
[[nodiscard]] Registration Subscribe(const kivcore::utility::ImmutableString& inStationID, Handler&& inHandler) {
  return Registration::Own(inStationID, SubscriptionDetail::NewTypedListener<T>(std::forward<Handler>(inHandler)));
}

/// Calls (inObject->*inMethod)(const T&) instead; inObject must outlive the
/// registration.
/// @{
template <class T, class Object, class Method>
[[nodiscard]] Registration Subscribe(Broadcaster& ioBroadcaster, Object* inObject, Method inMethod) {
  return Subscribe<T>(ioBroadcaster, SubscriptionDetail::BindMember<T>(inObject, inMethod));
}
template <class T, class Object, class Method>
[[nodiscard]] Registration Subscribe(const kivcore::utility::ImmutableString& inStationID, Object* inObject,
                                     Method inMethod) {
  return Subscribe<T>(inStationID, SubscriptionDetail::BindMember<T>(inObject, inMethod));
}
/// @}

}  // namespace Tarn
