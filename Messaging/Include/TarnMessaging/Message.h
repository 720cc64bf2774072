/// @file
/// Tarn::Message: the base of every message, and message type identity.
///
/// A message carries one thing of its own, the 32-bit ID of its type. The ID
/// is the hash of the type's decorated name (on GCC and Clang the mangled name
/// that typeid(T).name() gives, which includes the enclosing namespaces), so
/// every module that sees a message class computes the same ID without any
/// registration. A type with internal linkage (declared in an anonymous
/// namespace) is the one exception: two sources may each declare one of the
/// same name, and their decorated names are then equal, so the library hands
/// each such type an ID of its own, the name's hash for the first one seen
/// and a distinct value for every further one. The hash is not collision-free:
/// when two different names with external linkage hash to one ID, the second
/// one met is reported as a contract violation naming both types, and is
/// given an ID of its own. Listeners recognise a message
/// by its ID, most simply through Is<T>() and As<T>():
///
/// @code{.cpp}
///   void MyListener::ListenToMessage(const Tarn::Message& inMessage) {
///     if (const Progress* progress = inMessage.As<Progress>()) OnProgress(*progress);
///   }
/// @endcode
///
/// Concrete messages derive from Tarn::MessageImpl<T> (MessageImpl.h), never
/// from Message directly.
///
/// Calling CreateCallback needs the definition of boost::function, which this
/// header only declares: include <boost/function.hpp> where you call it.
///
/// Threading: HashMessageTypeNameToMessageID is pure and may be called from
/// any thread, and so may the ID lookup of any message type (it takes a
/// short spin lock, once per type and module). A message object is not
/// synchronised: the listeners of one broadcast read it on the broadcasting
/// thread.
#pragma once

#include <TarnMessaging/Export.h>

#include <kivcore/ImmutableString.h>

#include <boost/function/function_fwd.hpp>

#include <cstdint>
#include <type_traits>

namespace Tarn {

/// The 32-bit ID of a message type: the hash of the type's decorated name.
using MessageID = std::uint32_t;

template <class T>
class MessageImpl;

/// Whether T is a message type: a class deriving from MessageImpl<T>, naming
/// itself. A class that derives from another type's MessageImpl (or from
/// another message type) carries that type's ID, so a typed entry point that
/// took it would hand a listener the other type's objects cast to T. Every
/// typed entry point (Message::Is and As, Subscribe, a TypedStation's calls)
/// refuses such a T at compile time with TARN_MESSAGE_TYPE_REQUIRED.
template <class T>
struct IsMessageType : std::is_base_of<MessageImpl<T>, T> {};

/// The text of that refusal.
#define TARN_MESSAGE_TYPE_REQUIRED "T must be a message type that names itself: struct T : Tarn::MessageImpl<T>"

/// The message ID of a type name: h = h * 5 + (signed char)byte over the
/// bytes, from 0, wrapping modulo 2^32. inTypeName must not be null.
TARN_MESSAGING_API unsigned int HashMessageTypeNameToMessageID(const char* inTypeName) noexcept;

/// The base of every message: carries the 32-bit ID of the message's type,
/// by which listeners recognise it. Concrete messages derive through
/// MessageImpl<T>. A message is not synchronised: the listeners of one
/// broadcast read it on the broadcasting thread.
class TARN_MESSAGING_API Message {
public:
  /// The ID of the message's type (MessageImpl<T>::StaticMessageID()).
  MessageID GetMessageID() const noexcept { return mMessageID; }

  /// True when this message is a T (its ID is T's). T must be a message
  /// type, `struct T : MessageImpl<T>`: a class deriving from another type's
  /// MessageImpl shares that type's ID, so it is refused at compile time.
  template <class T>
  bool Is() const noexcept {
    static_assert(IsMessageType<T>::value, TARN_MESSAGE_TYPE_REQUIRED);
    return mMessageID == T::StaticMessageID();
  }
  /// This message as a T, or null when it is of another type. A mismatch is
  /// an ordinary miss, as for a listener that ignores other types, so it is
  /// not reported.
  template <class T>
  const T* As() const noexcept {
    return Is<T>() ? static_cast<const T*>(this) : nullptr;
  }

  virtual ~Message();

  /// A new heap copy of the complete message, owned by the caller, who ends
  /// it with delete. Throws std::bad_alloc when small-block storage is out.
  virtual Message* Clone() const = 0;

  /// A function that, when called, broadcasts a copy of this message on the
  /// station inStationID. The copy is taken now, not when the function runs.
  /// Throws std::bad_alloc when small-block storage is out.
  virtual boost::function<void()> CreateCallback(const kivcore::utility::ImmutableString& inStationID) const = 0;

protected:
  /// A message of the type whose ID is inMessageID; called by MessageImpl<T>.
  explicit Message(MessageID inMessageID) noexcept : mMessageID(inMessageID) {}
  /// Copies keep the ID; only derived classes copy.
  /// @{
  Message(const Message&) noexcept = default;
  Message& operator=(const Message&) noexcept = default;
  /// @}

private:
  MessageID mMessageID;  // set once by the constructor
};

namespace Detail {

/// The ID record of one message type with internal linkage, in the module
/// that declares the type; MessageImpl<T> makes it on first use and the
/// module's exit destroys it, which takes it off the library's list.
class TARN_MESSAGING_API LocalMessageType {
public:
  /// Takes an ID that no other live record holds: the hash of inTypeName if
  /// it is free. inTypeName must outlive the record.
  explicit LocalMessageType(const char* inTypeName) noexcept;
  ~LocalMessageType();
  LocalMessageType(const LocalMessageType&) = delete;
  LocalMessageType& operator=(const LocalMessageType&) = delete;

  /// The ID this type holds for its record's life.
  MessageID GetMessageID() const noexcept { return mMessageID; }

private:
  MessageID mMessageID;       // fixed by the constructor
  LocalMessageType* mNext;    // the library's list, guarded by its spin lock
  LocalMessageType* mPrevious;
};

/// True when a decorated type name names a type with internal linkage.
TARN_MESSAGING_API bool HasInternalLinkage(const char* inTypeName) noexcept;

/// The ID of a type with external linkage, computed once per type and module:
/// the hash of inTypeName, recorded with the name in one process-wide table.
/// A different name met with the same hash is a collision: it is reported
/// through the contract-check procedure, naming both types, and the later
/// name is given an ID of its own (the same in every module), so that no
/// listener takes one type for the other. The report cannot leave this
/// function: an exception of the error handler is caught and its text
/// written to standard error.
TARN_MESSAGING_API MessageID GlobalMessageID(const char* inTypeName) noexcept;

}  // namespace Detail

namespace StationUtils {
// Declared here for the message templates; documented in StationUtils.h.
/// Delivers inMessage synchronously to the station's listeners on the main
/// thread; does nothing on any other thread or when the ID is not registered.
TARN_MESSAGING_API void BroadcastMessage(const kivcore::utility::ImmutableString& inStationID,
                                         const Message& inMessage);
}  // namespace StationUtils

}  // namespace Tarn
