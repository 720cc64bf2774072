/// @file
/// Tarn::Remote wire-enabled message types: a message type that may cross a
/// process boundary declares, in one line beside its definition, a stable
/// wire name, a version and the fields that travel.
///
/// @code{.cpp}
///   namespace app {
///   struct Progress : Tarn::MessageImpl<Progress> {
///     std::int32_t mDone = 0;
///     std::int32_t mTotal = 0;
///     std::string mLabel;
///   };
///   TARN_WIRE_MESSAGE(Progress, "app.progress", 1, mDone, mTotal, mLabel)
///   }  // namespace app
/// @endcode
///
/// Why a wire name: a message's 32-bit ID is a hash of a decorated type name,
/// and types with internal linkage or colliding names get IDs that depend on
/// the order a process meets them, so the ID is not stable between
/// processes. The wire name is, and so is the field list: fields travel by
/// name (the member's name as written), so a peer built against an older or
/// newer definition of the type decodes the fields both know, leaves those
/// it lacks at their default value and skips those it does not know. The
/// version is for a change that a name match would misread (a field whose
/// meaning or unit changed): bump it, and peers on the other version count
/// and report the message instead of decoding it.
///
/// Rules for the line: at namespace scope, in the namespace of the type (its
/// lookup is by argument-dependent lookup), after the type's definition; the
/// type's name a plain identifier; from 1 to 16 fields, each a public data
/// member of type bool, an integer or enum type, float, double or
/// std::string; the type default-constructible (a decoder builds one, then
/// fills the fields it received). Anything else does not compile.
///
/// The line registers the type with this process's wire registry when the
/// module that holds it is loaded; a second type claiming a registered wire
/// name is a contract violation (the first keeps the name).
///
/// Threading: registration happens during static initialisation, before
/// main; FindWireType may be called from any thread (a short lock).
#pragma once

#include <TarnMessaging/Message.h>
#include <TarnMessaging/Remote/Export.h>

#include <cstddef>
#include <cstdint>
#include <limits>
#include <memory>
#include <string>
#include <type_traits>

namespace Tarn::Remote {

/// What a codec's encoder hears for each field of a message, in declaration
/// order, after Begin with the number of fields.
class TARN_REMOTE_API FieldWriter {
public:
  /// First, with the number of fields that follow.
  virtual void Begin(std::size_t inFieldCount) = 0;
  /// One field, by its name (a static string) and value: a signed integer
  /// or enum, an unsigned integer, a floating-point number, a bool, a string.
  /// @{
  virtual void Signed(const char* inName, std::int64_t inValue) = 0;
  virtual void Unsigned(const char* inName, std::uint64_t inValue) = 0;
  virtual void Real(const char* inName, double inValue) = 0;
  virtual void Boolean(const char* inName, bool inValue) = 0;
  virtual void Text(const char* inName, const std::string& inValue) = 0;
  /// @}

protected:
  ~FieldWriter() = default;
};

/// What a codec's decoder is asked for each field of the message it builds.
/// A field the input lacks is left as it is; a field whose value does not
/// fit (wrong kind, out of [inMin, inMax]) is left as it is and makes the
/// reader refuse the whole message.
class TARN_REMOTE_API FieldReader {
public:
  /// One field, by its name: sets ioValue from the input when the input has
  /// the field, within [inMin, inMax] for integers.
  /// @{
  virtual void Signed(const char* inName, std::int64_t& ioValue, std::int64_t inMin, std::int64_t inMax) = 0;
  virtual void Unsigned(const char* inName, std::uint64_t& ioValue, std::uint64_t inMax) = 0;
  virtual void Real(const char* inName, double& ioValue) = 0;
  virtual void Boolean(const char* inName, bool& ioValue) = 0;
  virtual void Text(const char* inName, std::string& ioValue) = 0;
  /// @}

protected:
  ~FieldReader() = default;
};

/// What a message type's values mean over time.
enum class WireKind {
  kEvent,  ///< each message counts: every one is delivered or reported lost
  kState,  ///< the latest value is what counts: a node sends it again to an importer that (re)connects
};

/// The wire description of one message type, made by TARN_WIRE_MESSAGE or
/// TARN_WIRE_STATE.
struct WireType {
  const char* mWireName;                                   ///< stable across processes; a static string
  std::uint32_t mVersion;                                  ///< only equal versions decode
  MessageID (*mMessageID)();                               ///< the type's in-process ID
  std::unique_ptr<Message> (*mCreate)();                   ///< a default-constructed message
  void (*mWrite)(const Message& inMessage, FieldWriter& ioWriter);  ///< inMessage is of this type
  void (*mRead)(Message& ioMessage, FieldReader& ioReader);         ///< ioMessage is of this type
  WireKind mKind = WireKind::kEvent;                               ///< events unless declared a state
};

/// Adds inType to this process's wire registry and returns true. A wire
/// name already registered for another message type is reported through the
/// contract-check procedure (`FindWireType(inType.mWireName) == NULL`) and
/// the earlier type keeps it; registering the same type again does nothing.
TARN_REMOTE_API bool RegisterWireType(const WireType& inType) noexcept;

/// The registered type of a wire name, or of an in-process message ID; null
/// when none is registered. inWireName must not be null; it need not be
/// terminated (inLength bytes are compared).
/// @{
TARN_REMOTE_API const WireType* FindWireType(const char* inWireName, std::size_t inLength) noexcept;
TARN_REMOTE_API const WireType* FindWireType(MessageID inMessageID) noexcept;
/// @}

/// @cond
namespace Detail {

template <class F>
struct DependentFalse : std::false_type {};

template <class F>
void WriteField(FieldWriter& ioWriter, const char* inName, const F& inField) {
  if constexpr (std::is_same<F, bool>::value) {
    ioWriter.Boolean(inName, inField);
  } else if constexpr (std::is_enum<F>::value) {
    WriteField(ioWriter, inName, static_cast<std::underlying_type_t<F>>(inField));
  } else if constexpr (std::is_integral<F>::value && std::is_signed<F>::value) {
    ioWriter.Signed(inName, inField);
  } else if constexpr (std::is_integral<F>::value) {
    ioWriter.Unsigned(inName, inField);
  } else if constexpr (std::is_floating_point<F>::value) {
    ioWriter.Real(inName, static_cast<double>(inField));
  } else if constexpr (std::is_same<F, std::string>::value) {
    ioWriter.Text(inName, inField);
  } else {
    static_assert(DependentFalse<F>::value,
                  "a wire field must be bool, an integer or enum, float, double or std::string");
  }
}

template <class F>
void ReadField(FieldReader& ioReader, const char* inName, F& ioField) {
  if constexpr (std::is_same<F, bool>::value) {
    ioReader.Boolean(inName, ioField);
  } else if constexpr (std::is_enum<F>::value) {
    auto value = static_cast<std::underlying_type_t<F>>(ioField);
    ReadField(ioReader, inName, value);
    ioField = static_cast<F>(value);
  } else if constexpr (std::is_integral<F>::value && std::is_signed<F>::value) {
    std::int64_t value = ioField;
    ioReader.Signed(inName, value, std::numeric_limits<F>::min(), std::numeric_limits<F>::max());
    ioField = static_cast<F>(value);  // the reader kept value within [min, max]
  } else if constexpr (std::is_integral<F>::value) {
    std::uint64_t value = ioField;
    ioReader.Unsigned(inName, value, std::numeric_limits<F>::max());
    ioField = static_cast<F>(value);
  } else if constexpr (std::is_floating_point<F>::value) {
    double value = ioField;
    ioReader.Real(inName, value);
    ioField = static_cast<F>(value);
  } else if constexpr (std::is_same<F, std::string>::value) {
    ioReader.Text(inName, ioField);
  } else {
    static_assert(DependentFalse<F>::value,
                  "a wire field must be bool, an integer or enum, float, double or std::string");
  }
}

template <class T>
std::unique_ptr<Message> CreateWireMessage() {
  static_assert(std::is_default_constructible<T>::value, "a wire message type must be default-constructible");
  return std::unique_ptr<Message>(new T());
}

}  // namespace Detail
/// @endcond

/// The wire description of T, which TARN_WIRE_MESSAGE declared.
template <class T>
const WireType& WireTypeOf() {
  return TarnWireTypeOf(static_cast<const T*>(nullptr));
}

}  // namespace Tarn::Remote

/// @cond
// The field list, one macro call per field (up to 16).
#define TARN_WIRE_DETAIL_X(x) x
#define TARN_WIRE_DETAIL_PICK(_1, _2, _3, _4, _5, _6, _7, _8, _9, _10, _11, _12, _13, _14, _15, _16, N, ...) N
#define TARN_WIRE_DETAIL_E1(A, f) A(f)
#define TARN_WIRE_DETAIL_E2(A, f, ...) A(f) TARN_WIRE_DETAIL_X(TARN_WIRE_DETAIL_E1(A, __VA_ARGS__))
#define TARN_WIRE_DETAIL_E3(A, f, ...) A(f) TARN_WIRE_DETAIL_X(TARN_WIRE_DETAIL_E2(A, __VA_ARGS__))
#define TARN_WIRE_DETAIL_E4(A, f, ...) A(f) TARN_WIRE_DETAIL_X(TARN_WIRE_DETAIL_E3(A, __VA_ARGS__))
#define TARN_WIRE_DETAIL_E5(A, f, ...) A(f) TARN_WIRE_DETAIL_X(TARN_WIRE_DETAIL_E4(A, __VA_ARGS__))
#define TARN_WIRE_DETAIL_E6(A, f, ...) A(f) TARN_WIRE_DETAIL_X(TARN_WIRE_DETAIL_E5(A, __VA_ARGS__))
#define TARN_WIRE_DETAIL_E7(A, f, ...) A(f) TARN_WIRE_DETAIL_X(TARN_WIRE_DETAIL_E6(A, __VA_ARGS__))
#define TARN_WIRE_DETAIL_E8(A, f, ...) A(f) TARN_WIRE_DETAIL_X(TARN_WIRE_DETAIL_E7(A, __VA_ARGS__))
#define TARN_WIRE_DETAIL_E9(A, f, ...) A(f) TARN_WIRE_DETAIL_X(TARN_WIRE_DETAIL_E8(A, __VA_ARGS__))
#define TARN_WIRE_DETAIL_E10(A, f, ...) A(f) TARN_WIRE_DETAIL_X(TARN_WIRE_DETAIL_E9(A, __VA_ARGS__))
#define TARN_WIRE_DETAIL_E11(A, f, ...) A(f) TARN_WIRE_DETAIL_X(TARN_WIRE_DETAIL_E10(A, __VA_ARGS__))
#define TARN_WIRE_DETAIL_E12(A, f, ...) A(f) TARN_WIRE_DETAIL_X(TARN_WIRE_DETAIL_E11(A, __VA_ARGS__))
#define TARN_WIRE_DETAIL_E13(A, f, ...) A(f) TARN_WIRE_DETAIL_X(TARN_WIRE_DETAIL_E12(A, __VA_ARGS__))
#define TARN_WIRE_DETAIL_E14(A, f, ...) A(f) TARN_WIRE_DETAIL_X(TARN_WIRE_DETAIL_E13(A, __VA_ARGS__))
#define TARN_WIRE_DETAIL_E15(A, f, ...) A(f) TARN_WIRE_DETAIL_X(TARN_WIRE_DETAIL_E14(A, __VA_ARGS__))
#define TARN_WIRE_DETAIL_E16(A, f, ...) A(f) TARN_WIRE_DETAIL_X(TARN_WIRE_DETAIL_E15(A, __VA_ARGS__))
#define TARN_WIRE_DETAIL_EACH(A, ...)                                                                             \
  TARN_WIRE_DETAIL_X(TARN_WIRE_DETAIL_PICK(__VA_ARGS__, TARN_WIRE_DETAIL_E16, TARN_WIRE_DETAIL_E15,              \
                                           TARN_WIRE_DETAIL_E14, TARN_WIRE_DETAIL_E13, TARN_WIRE_DETAIL_E12,     \
                                           TARN_WIRE_DETAIL_E11, TARN_WIRE_DETAIL_E10, TARN_WIRE_DETAIL_E9,      \
                                           TARN_WIRE_DETAIL_E8, TARN_WIRE_DETAIL_E7, TARN_WIRE_DETAIL_E6,        \
                                           TARN_WIRE_DETAIL_E5, TARN_WIRE_DETAIL_E4, TARN_WIRE_DETAIL_E3,        \
                                           TARN_WIRE_DETAIL_E2, TARN_WIRE_DETAIL_E1)(A, __VA_ARGS__))
#define TARN_WIRE_DETAIL_COUNT(...) \
  TARN_WIRE_DETAIL_X(TARN_WIRE_DETAIL_PICK(__VA_ARGS__, 16, 15, 14, 13, 12, 11, 10, 9, 8, 7, 6, 5, 4, 3, 2, 1))
#define TARN_WIRE_DETAIL_WRITE(f) ::Tarn::Remote::Detail::WriteField(ioWriter, #f, message.f);
#define TARN_WIRE_DETAIL_READ(f) ::Tarn::Remote::Detail::ReadField(ioReader, #f, message.f);
/// @endcond

/// Declares the message type T wire-enabled under inWireName (a string
/// literal) and inVersion, with the listed fields; see the file comment.
#define TARN_WIRE_MESSAGE(T, inWireName, inVersion, ...) \
  TARN_WIRE_DETAIL_DECLARE(T, inWireName, inVersion, ::Tarn::Remote::WireKind::kEvent, __VA_ARGS__)

/// The same for a state-like type, whose latest value is what counts (a
/// progress, a selection): an exporting node keeps the latest value it sent
/// of each such type on each station, and sends it again to an importer that
/// connects or reconnects (Node.h).
#define TARN_WIRE_STATE(T, inWireName, inVersion, ...) \
  TARN_WIRE_DETAIL_DECLARE(T, inWireName, inVersion, ::Tarn::Remote::WireKind::kState, __VA_ARGS__)

/// @cond
#define TARN_WIRE_DETAIL_DECLARE(T, inWireName, inVersion, inKind, ...)                                          \
  inline const ::Tarn::Remote::WireType& TarnWireTypeOf(const T*) {                                              \
    static_assert(::Tarn::IsMessageType<T>::value, TARN_MESSAGE_TYPE_REQUIRED);                                  \
    static const ::Tarn::Remote::WireType sType{                                                                 \
        inWireName, inVersion, &T::StaticMessageID, &::Tarn::Remote::Detail::CreateWireMessage<T>,               \
        [](const ::Tarn::Message& inMessage, ::Tarn::Remote::FieldWriter& ioWriter) {                            \
          const T& message = static_cast<const T&>(inMessage);                                                   \
          ioWriter.Begin(TARN_WIRE_DETAIL_COUNT(__VA_ARGS__));                                                   \
          TARN_WIRE_DETAIL_EACH(TARN_WIRE_DETAIL_WRITE, __VA_ARGS__)                                             \
        },                                                                                                       \
        [](::Tarn::Message& ioMessage, ::Tarn::Remote::FieldReader& ioReader) {                                  \
          T& message = static_cast<T&>(ioMessage);                                                               \
          TARN_WIRE_DETAIL_EACH(TARN_WIRE_DETAIL_READ, __VA_ARGS__)                                              \
        },                                                                                                       \
        inKind};                                                                                                 \
    return sType;                                                                                                \
  }                                                                                                              \
  inline const bool kTarnWireRegistered_##T = ::Tarn::Remote::RegisterWireType(TarnWireTypeOf(static_cast<const T*>(nullptr)));
/// @endcond
