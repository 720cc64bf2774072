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
/// copy carried to the main thread in one small block, made by the library).
/// T overrides none of them; its copy constructor must copy every parameter.
/// Only T itself can build its MessageImpl<T> base, so a class that names
/// another type (`struct Saved : Tarn::MessageImpl<Progress>`) does not
/// compile, and T must derive from MessageImpl<T>.
///
/// The header pulls in no Boost header beyond a forward declaration, so that
/// every source declaring a message type compiles fast.
///
/// Threading: StaticMessageID caches the ID in a per-module slot without a
/// lock (a relaxed atomic); concurrent first uses store the same value. Clone
/// and CreateCallback only read the message and may run on any thread.
#pragma once

#include <TarnMessaging/Message.h>

#include <kivcore/ImmutableString.h>
#include <kivcore/SmallBlockAllocator.h>

#include <atomic>
#include <cstddef>
#include <new>
#include <type_traits>
#include <typeinfo>

namespace boost {
template <class T>
class shared_ptr;
}  // namespace boost

namespace Tarn {
namespace Detail {

/// What MessageImpl<T> shares for every T, compiled once in the library:
/// CreateCallback, which copies the complete message through the two hooks
/// that MessageImpl<T> implements.
class TARN_MESSAGING_API MessageImplBase : public Message {
public:
  /// A function that broadcasts a copy of this message, taken now, on
  /// inStationID. The copy and its station ID share one small block, owned by
  /// the function's copies. Throws std::bad_alloc when storage is out.
  boost::function<void()> CreateCallback(const kivcore::utility::ImmutableString& inStationID) const override;

protected:
  /// A message of the type whose ID is inMessageID; called by MessageImpl<T>.
  explicit MessageImplBase(MessageID inMessageID) noexcept : Message(inMessageID) {}
  /// Copies keep the ID; only derived classes copy.
  /// @{
  MessageImplBase(const MessageImplBase&) noexcept = default;
  MessageImplBase& operator=(const MessageImplBase&) noexcept = default;
  /// @}
  ~MessageImplBase() override;

private:
  // The bytes a copy of the complete message needs.
  virtual std::size_t CopySize() const noexcept = 0;
  // Copy-constructs the complete message at inStorage (CopySize() bytes,
  // aligned for std::max_align_t) and returns it.
  virtual Message* CopyInto(void* inStorage) const = 0;
};

}  // namespace Detail

/// The template every concrete message T derives through, as
/// `struct T : MessageImpl<T>`: gives T its ID, Clone and CreateCallback. T's
/// copy constructor must copy every parameter. Clone and CreateCallback only
/// read the message and may run on any thread.
template <class T>
class MessageImpl : public Detail::MessageImplBase {
public:
  /// The ID of T: the hash of T's decorated name, computed on first use (a
  /// type with internal linkage gets an ID no other such type holds; a type
  /// whose hash an earlier type of another name holds is reported and gets
  /// an ID of its own, Message.h).
  static MessageID StaticMessageID() noexcept {
    // Relaxed atomics: threads that meet the empty slot at once compute and
    // store the same value, so no ordering is needed, only freedom from a race.
    MessageID id = sMessageID.load(std::memory_order_relaxed);
    if (id == 0) {
      const char* const name = typeid(T).name();
      id = Detail::HasInternalLinkage(name) ? LocalType().GetMessageID() : Detail::GlobalMessageID(name);
      sMessageID.store(id, std::memory_order_relaxed);
    }
    return id;
  }

  /// A DynamicallyAllocatedMessage<T> copy of this message, in small-block
  /// storage, owned by the caller. Throws std::bad_alloc when storage is out.
  Message* Clone() const override;

private:
  // Only T may build this base, so a class deriving from MessageImpl<U> for
  // another type U fails to compile, and the compiler quotes the line below.
  friend T;
  MessageImpl() noexcept : MessageImplBase(StaticMessageID()) {  // error? write struct T : Tarn::MessageImpl<T>
    static_assert(std::is_base_of<MessageImpl, T>::value,
                  "a message type T must derive from Tarn::MessageImpl<T>, naming itself");
    static_assert(alignof(T) <= alignof(std::max_align_t), "a message type may not be over-aligned");
  }

  std::size_t CopySize() const noexcept override { return sizeof(T); }
  Message* CopyInto(void* inStorage) const override { return new (inStorage) T(static_cast<const T&>(*this)); }

  // Made on the first use of a type with internal linkage only; its module's
  // exit takes it off the library's list again.
  static const Detail::LocalMessageType& LocalType() noexcept {
    static const Detail::LocalMessageType sType(typeid(T).name());
    return sType;
  }

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

/// A copy of a message and of a station ID, for code that carries a message
/// to the main thread in a boost::shared_ptr of its own (include
/// <boost/shared_ptr.hpp> to use Deliver). CreateCallback does not need it.
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

}  // namespace Tarn
