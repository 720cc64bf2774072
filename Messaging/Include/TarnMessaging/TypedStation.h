/// @file
/// Tarn::TypedStation<Ts...>: a station ID that names the message types its
/// station carries, so that sender and receiver are checked against one
/// declaration at compile time.
///
/// @code{.cpp}
///   // jobs.h, shared by the modules that send and those that listen:
///   inline const Tarn::TypedStation<Progress, Saved> kStation_Jobs("com.example.jobs");
///
///   Tarn::StationRegistry::RegisterStation(kStation_Jobs.GetStationID(), nullptr);
///   Tarn::Registration line = Tarn::Subscribe<Progress>(kStation_Jobs, [](const Progress& inProgress) { ... });
///   Tarn::StationUtils::PostMessageToUIThread(kStation_Jobs, Progress(1, 2), false);
///   Tarn::StationUtils::PostMessageToUIThread(kStation_Jobs, Tidy(), false);  // does not compile: not carried
/// @endcode
///
/// Subscribe, BroadcastMessage and every kind of post through the handle
/// refuse, at compile time, a message type that is not among Ts, and every T
/// that is not a message type naming itself (IsMessageType). Each call is
/// the string-ID call of the same name on GetStationID(), with the same
/// behaviour, threading and reports; a typed station is a name for an ID,
/// not a second station. The handle does not convert to its ID by itself, so
/// a string-ID call cannot take it and skip the check; other calls (a
/// listener of your own, RetainStation, RegisterStation) take GetStationID().
///
/// Threading: a handle is a constant value; its members may be called from
/// any thread, as the string-ID calls they make.
#pragma once

#include <TarnMessaging/Message.h>
#include <TarnMessaging/PostCancelToken.h>
#include <TarnMessaging/StationUtils.h>
#include <TarnMessaging/Subscription.h>

#include <kivcore/ImmutableString.h>

#include <cstdint>
#include <type_traits>
#include <utility>

namespace Tarn {

/// A station ID and the message types Ts its station carries.
template <class... Ts>
class TypedStation {
  static_assert(sizeof...(Ts) > 0, "a TypedStation names the message types it carries");
  static_assert((IsMessageType<Ts>::value && ...), TARN_MESSAGE_TYPE_REQUIRED);

public:
  /// Whether the station carries messages of type T.
  template <class T>
  static constexpr bool kCarries = (std::is_same<T, Ts>::value || ...);

  /// The station of the ID whose text is inStationID (a literal, kept as a
  /// static string).
  explicit TypedStation(const char* inStationID)
      : mStationID(kivcore::utility::ImmutableString::CreateStatic(inStationID)) {}
  /// The station of inStationID.
  explicit TypedStation(kivcore::utility::ImmutableString inStationID) noexcept
      : mStationID(std::move(inStationID)) {}

  /// The ID, for the calls that take no message type.
  const kivcore::utility::ImmutableString& GetStationID() const noexcept { return mStationID; }

private:
  kivcore::utility::ImmutableString mStationID;
};

namespace Detail {
/// The compile-time check every typed call makes: T is a message type naming
/// itself, and one of Ts. One place for the wording of both refusals.
template <class T, class... Ts>
constexpr void RequireCarried() noexcept {
  static_assert(IsMessageType<T>::value, TARN_MESSAGE_TYPE_REQUIRED);
  static_assert(TypedStation<Ts...>::template kCarries<T>,
                "this TypedStation does not carry messages of type T: add T to its declaration");
}
}  // namespace Detail

/// Subscribe<T> on a typed station; T must be one of the types it carries.
/// @{
template <class T, class... Ts, class Handler>
[[nodiscard]] Registration Subscribe(const TypedStation<Ts...>& inStation, Handler&& inHandler) {
  Detail::RequireCarried<T, Ts...>();
  return Subscribe<T>(inStation.GetStationID(), std::forward<Handler>(inHandler));
}
template <class T, class... Ts, class Object, class Method>
[[nodiscard]] Registration Subscribe(const TypedStation<Ts...>& inStation, Object* inObject, Method inMethod) {
  Detail::RequireCarried<T, Ts...>();
  return Subscribe<T>(inStation.GetStationID(), inObject, inMethod);
}
/// @}

namespace StationUtils {

/// The string-ID calls of the same names, on a typed station; the message's
/// type must be one of the types it carries.
/// @{
template <class... Ts, class T>
void BroadcastMessage(const TypedStation<Ts...>& inStation, const T& inMessage) {
  Detail::RequireCarried<T, Ts...>();
  BroadcastMessage(inStation.GetStationID(), static_cast<const Message&>(inMessage));
}
template <class... Ts, class T>
void PostMessageToUIThread(const TypedStation<Ts...>& inStation, const T& inMessage, bool inForceAsync) {
  Detail::RequireCarried<T, Ts...>();
  PostMessageToUIThread(inStation.GetStationID(), static_cast<const Message&>(inMessage), inForceAsync);
}
template <class... Ts, class T>
void PostMessageToUIThread(const TypedStation<Ts...>& inStation, const T& inMessage, const PostCancelToken& inToken) {
  Detail::RequireCarried<T, Ts...>();
  PostMessageToUIThread(inStation.GetStationID(), static_cast<const Message&>(inMessage), inToken);
}
template <class... Ts, class T>
void PostCoalescedMessageToUIThread(const TypedStation<Ts...>& inStation, const T& inMessage) {
  Detail::RequireCarried<T, Ts...>();
  PostCoalescedMessageToUIThread(inStation.GetStationID(), static_cast<const Message&>(inMessage));
}
template <class... Ts, class T>
void PostCoalescedMessageToUIThread(const TypedStation<Ts...>& inStation, const T& inMessage,
                                    std::uint64_t inCallerKey) {
  Detail::RequireCarried<T, Ts...>();
  PostCoalescedMessageToUIThread(inStation.GetStationID(), static_cast<const Message&>(inMessage), inCallerKey);
}
template <class... Ts, class T>
void PostMessageAtIdleTime(const TypedStation<Ts...>& inStation, const T& inMessage) {
  Detail::RequireCarried<T, Ts...>();
  PostMessageAtIdleTime(inStation.GetStationID(), static_cast<const Message&>(inMessage));
}
/// @}

}  // namespace StationUtils
}  // namespace Tarn
