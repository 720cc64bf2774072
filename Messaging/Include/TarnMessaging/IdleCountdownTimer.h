/// @file
/// Tarn::IdleCountdownTimer: a one-shot notification, at an idle moment, that
/// a set time has passed since the timer was armed.
///
/// @code{.cpp}
///   Tarn::IdleCountdownTimer autosave;
///   autosave.SetDuration(5000);
///   autosave.SetCookie(42);
///   Tarn::StationUtils::AddListener(autosave.GetStationID(), &saver);
///   autosave.ArmTimer();   // saver hears IdleCountdownTimerMessage(42) at the
///                          // first ApplicationIdleMessage on kStation_Idle
///                          // at least 5 s from now
/// @endcode
///
/// The host broadcasts ApplicationIdleMessage on kStation_Idle whenever it is
/// idle; an armed timer listens there, and at the first idle message at or
/// after its deadline it detaches and broadcasts one IdleCountdownTimerMessage
/// on its own station. Arm it again for every further firing (a handler of the
/// timer's message may do so). Time is read from Tarn::TimeStamp as whole
/// milliseconds on a 64-bit count, so every duration up to 2^32 - 1 ms (49.7
/// days) fires no earlier than its length, and the wrap of a 32-bit
/// millisecond count changes nothing. Arming before library initialization
/// attaches nothing; arm again once the library is up. A timer that lives
/// across Messaging::Terminate and Initialize works again once armed anew:
/// ArmTimer and GetStationID register its station again if Terminate dropped
/// it, and ArmTimer attaches to the new idle station.
///
/// Threading: main thread only, like the idle broadcasts that drive it. Do not
/// destroy the timer from a handler of its own message. The destructor
/// detaches the timer from kStation_Idle before anything of the timer is
/// destroyed; a host that attaches the timer to a broadcaster of its own
/// detaches it there before destroying it.
#pragma once

#include <TarnMessaging/Export.h>
#include <TarnMessaging/Listener.h>
#include <TarnMessaging/MessageImpl.h>

#include <kivcore/ImmutableString.h>

#include <cstdint>

namespace Tarn {

/// Broadcast by the host on kStation_Idle when the application is idle.
class TARN_MESSAGING_API ApplicationIdleMessage : public MessageImpl<ApplicationIdleMessage> {
public:
  ApplicationIdleMessage() noexcept = default;
};

/// Broadcast by a timer on its own station when it fires.
class TARN_MESSAGING_API IdleCountdownTimerMessage : public MessageImpl<IdleCountdownTimerMessage> {
public:
  /// A message carrying the timer's cookie inCookie.
  explicit IdleCountdownTimerMessage(std::uint32_t inCookie) noexcept : mCookie(inCookie) {}
  /// The cookie the timer was given with SetCookie.
  std::uint32_t GetCookie() const noexcept { return mCookie; }

private:
  std::uint32_t mCookie;
};

/// A one-shot notification, at an idle moment, that a set time has passed
/// since the timer was armed: broadcasts one IdleCountdownTimerMessage on its
/// own station at the first idle broadcast at or after its deadline. Main
/// thread only; do not destroy it from a handler of its own message.
class TARN_MESSAGING_API IdleCountdownTimer : public Listener {
public:
  /// Registers the timer's own unique station; the timer is not armed.
  IdleCountdownTimer();
  /// Detaches from kStation_Idle if armed and disposes of the timer's station.
  ~IdleCountdownTimer() override;
  IdleCountdownTimer(const IdleCountdownTimer&) = delete;
  IdleCountdownTimer& operator=(const IdleCountdownTimer&) = delete;

  /// Starts or restarts the countdown from now.
  void ArmTimer();
  /// The countdown length (ms) for the next ArmTimer; a running one is kept.
  void SetDuration(unsigned int inDuration) noexcept { mDuration = inDuration; }
  /// The value carried by the messages of the following firings.
  void SetCookie(unsigned int inCookie) noexcept { mCookie = inCookie; }
  /// The station the timer's messages are broadcast on; registers it again
  /// when Terminate dropped it. Throws std::bad_alloc when storage is out.
  kivcore::utility::ImmutableString GetStationID() const;

  void ListenToMessage(const Message& inMessage) override;

private:
  TARN_MESSAGING_LOCAL static std::int64_t NowMilliSeconds();

  kivcore::utility::ImmutableString mStationID;  // registered while the library is up
  bool mListeningForIdle = false;                // follows the idle station's own record
  std::uint32_t mDuration = 0;
  std::int64_t mDeadline = 0;                    // on the 64-bit millisecond count
  std::uint32_t mCookie = 0;
  bool mFiring = false;
};

}  // namespace Tarn
