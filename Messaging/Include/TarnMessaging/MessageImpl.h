/// @file
/// Tarn::MessageImpl<T>: the template every concrete message derives through.
///
/// Declare a message type once, as a plain class naming itself:
///
/// @code{.cpp}
///   struct Progress : Tarn::MessageImpl<Progress> {
///     Progress(int inDone, int inTotal) : mDone(inDone), mTotal(inTotal) {}
///     int mDone;
///     int mTotal;
///   };
/// @endcode
///
/// MessageImpl<T> gives T its ID (StaticMessageID), Clone (a copy in
/// small-block storage, DynamicallyAllocatedMessage<T>) and CreateCallback (a
/// copy carried to the main thread, MessageCallbackImpl<T>). T overrides none
/// of them; its copy constructor must copy every parameter.
///
/// Threading: StaticMessageID caches the ID in a per-module slot without a
/// lock (a relaxed atomic); concurrent first uses store the same value. Clone and CreateCallback
/// only read the message and may run on any thread.
#pragma once

#include <TarnMessaging/Message.h>

#include <kivcore/ImmutableString.h>
#include <kivcore/SmallBlockAllocator.h>

#include <boost/bind/bind.hpp>
#include <boost/function.hpp>
#include <boost/make_shared.hpp>
#include <boost/shared_ptr.hpp>

#include <atomic>
#include <typeinfo>

namespace Tarn {

/// The template every concrete message T derives through, as
/// `struct T : MessageImpl<T>`: gives T its ID, Clone and CreateCallback. T's
/// copy constructor must copy every parameter. Clone and CreateCallback only
/// read the message and may run on any thread.
template <class T>
class MessageImpl : public Message {
public:
  /// A message with T's ID.
  MessageImpl() noexcept : Message(StaticMessageID()) {}

  /// The ID of T: the hash of T's decorated name, computed on first use.
  static MessageID StaticMessageID() noexcept {
    // Relaxed atomics: threads that meet the empty slot at once compute and
    // store the same value, so no ordering is needed, only freedom from a race.
    MessageID id = sMessageID.load(std::memory_order_relaxed);
    if (id == 0) {
      id = HashMessageTypeNameToMessageID(typeid(T).name());
      sMessageID.store(id, std::memory_order_relaxed);
    }
    return id;
  }

  /// A DynamicallyAllocatedMessage<T> copy of this message, in small-block
  /// storage, owned by the caller. Throws std::bad_alloc when storage is out.
  Message* Clone() const override;
  /// A function that broadcasts a copy of this message, taken now, on
  /// inStationID; the copy lives in one small-block allocation shared by the
  /// function's copies. Throws std::bad_alloc when storage is out.
  boost::function<void()> CreateCallback(const kivcore::utility::ImmutableString& inStationID) const override;

private:
  static inline std::atomic<MessageID> sMessageID{0};  // per module; 0 means not computed yet
};

/// An empty marker base of heap copies; it has no data and no effect.
template <class T>
class ClassWatcherTrackable {};

/// The heap copy that Clone returns; its storage comes from the small-block
/// allocator and goes back there, with its exact size, on delete.
template <class T>
class DynamicallyAllocatedMessage : public T,
                                    public ClassWatcherTrackable<T>,
                                    public kivcore::utility::SmallBlockAllocator::Allocated<DynamicallyAllocatedMessage<T>> {
public:
  /// A copy of inMessage.
  explicit DynamicallyAllocatedMessage(const T& inMessage) : T(inMessage) {}
};

/// A posted message on its way to the main thread: a copy of the message and
/// of the station ID, shared by the function objects that CreateCallback
/// returns and freed with the last of them (on whichever thread that is).
template <class T>
class MessageCallbackImpl {
public:
  /// Copies inMessage and inStationID.
  MessageCallbackImpl(const T& inMessage, const kivcore::utility::ImmutableString& inStationID)
      : mMessage(inMessage), mStationID(inStationID) {}

  /// Broadcasts the copy on its station, on the calling thread.
  static void Deliver(const boost::shared_ptr<MessageCallbackImpl>& inCallback) {
    StationUtils::BroadcastMessage(inCallback->mStationID, inCallback->mMessage);
  }

  T mMessage;                                    ///< the copy to broadcast
  kivcore::utility::ImmutableString mStationID;  ///< the station to broadcast it on
};

template <class T>
Message* MessageImpl<T>::Clone() const {
  return new DynamicallyAllocatedMessage<T>(static_cast<const T&>(*this));
}

template <class T>
boost::function<void()> MessageImpl<T>::CreateCallback(const kivcore::utility::ImmutableString& inStationID) const {
  using Callback = MessageCallbackImpl<T>;
  // One small-block allocation holds both the object and its shared count;
  // the bound call (a function pointer and a shared_ptr) fits inside the
  // boost::function without an allocation of its own.
  boost::shared_ptr<Callback> callback = boost::allocate_shared<Callback>(
      kivcore::utility::SmallBlockAllocator::STLAllocator<Callback>(), static_cast<const T&>(*this), inStationID);
  return boost::function<void()>(boost::bind(&Callback::Deliver, callback));
}

}  // namespace Tarn
