// Calls that must not compile, one per TARN_CASE; case 0 holds the same calls
// done right and must compile, so that a refusal is known to come from the
// check and not from a broken source. Run by cmake/CheckCompileFailure.cmake.
#include <TarnMessaging.h>

struct Progress : Tarn::MessageImpl<Progress> {};
struct Tidy : Tarn::MessageImpl<Tidy> {};
// Derives from another type's base: it would carry Progress's ID.
struct Saved : Tarn::MessageImpl<Progress> {};
// Derives from another message type: the same.
struct Special : Progress {};

void Calls(const Tarn::Message& inMessage) {
  const Tarn::TypedStation<Progress> jobs("compile.fail.jobs");
  const auto handler = [](const auto&) {};
  Tarn::Registration registration;
  namespace Utils = Tarn::StationUtils;
#if TARN_CASE == 0
  registration = Tarn::Subscribe<Progress>(Tarn::kStation_StatusBar, handler);
  registration = Tarn::Subscribe<Progress>(jobs, handler);
  (void)inMessage.As<Progress>();
  Utils::BroadcastMessage(jobs, Progress());
  Utils::PostMessageToUIThread(jobs, Progress(), false);
  Utils::PostMessageToUIThread(jobs, Progress(), Tarn::PostCancelToken());
  Utils::PostCoalescedMessageToUIThread(jobs, Progress());
  Utils::PostCoalescedMessageToUIThread(jobs, Progress(), 7);
  Utils::PostMessageAtIdleTime(jobs, Progress());
#elif TARN_CASE == 1
  registration = Tarn::Subscribe<Saved>(Tarn::kStation_StatusBar, handler);
#elif TARN_CASE == 2
  registration = Tarn::Subscribe<Special>(Tarn::kStation_StatusBar, handler);
#elif TARN_CASE == 3
  (void)inMessage.As<Saved>();
#elif TARN_CASE == 4
  (void)inMessage.Is<Special>();
#elif TARN_CASE == 5
  registration = Tarn::Subscribe<Tidy>(jobs, handler);
#elif TARN_CASE == 6
  Utils::BroadcastMessage(jobs, Tidy());
#elif TARN_CASE == 7
  Utils::PostMessageToUIThread(jobs, Tidy(), false);
#elif TARN_CASE == 8
  Utils::PostMessageToUIThread(jobs, Tidy(), Tarn::PostCancelToken());
#elif TARN_CASE == 9
  Utils::PostCoalescedMessageToUIThread(jobs, Tidy(), 7);
#elif TARN_CASE == 10
  Utils::PostMessageAtIdleTime(jobs, Tidy());
#elif TARN_CASE == 11
  Utils::PostMessageToUIThread(jobs.GetStationID(), Tidy(), false);  // the ID alone is unchecked: compiles
  Utils::PostMessageToUIThread(Tarn::TypedStation<Saved>("compile.fail.saved"), Progress(), false);
#endif
}
