// The messages of tarn-demo and the clock their time stamps come from.
#pragma once

#include <TarnMessaging.h>

#include <chrono>
#include <cstdint>

namespace tarn_demo {

// Nanoseconds of the steady clock: comparable across threads, never set back.
inline std::int64_t SteadyNanoSeconds() {
  return std::chrono::duration_cast<std::chrono::nanoseconds>(std::chrono::steady_clock::now().time_since_epoch())
      .count();
}

// Posted by a worker to kStation_StatusBar after each unit of work.
struct ProgressMessage : Tarn::MessageImpl<ProgressMessage> {
  ProgressMessage(std::uint32_t inWorker, std::uint32_t inSequence, std::int64_t inPostedAt)
      : mWorker(inWorker), mSequence(inSequence), mPostedAt(inPostedAt) {}
  std::uint32_t mWorker;    // index of the posting worker
  std::uint32_t mSequence;  // 0, 1, 2, ... per worker
  std::int64_t mPostedAt;   // SteadyNanoSeconds() just before the post
};

// Broadcast on kStation_AppSuspend and kStation_AppResume.
struct SuspendMessage : Tarn::MessageImpl<SuspendMessage> {};
struct ResumeMessage : Tarn::MessageImpl<ResumeMessage> {};

// The cookie of the autosave timer's IdleCountdownTimerMessage.
constexpr std::uint32_t kAutosaveCookie = 0x5A7E;

}  // namespace tarn_demo
