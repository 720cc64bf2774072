// A program for the lifecycle tests, run as a child process so that its exit
// (and the static destruction that comes with it) can be watched from
// outside. Mode "queued" disposes of a station while no main thread is
// registered, so that it waits in the registry's pending list until exit; it
// must be deleted while the registry is still alive, silently, and says so on
// standard output. Mode "unterminated" exits with a post still queued and
// the library still initialized, which must be reported at exit. Modes
// "late" and "violation" are described below.
//
// Exit status 0 when the mode ran, 1 for an unknown mode, 2 when the
// registry did not behave as the mode needs.
#include <TarnMessaging.h>

#include <kivcore/kivcore.h>

#include <cstdio>
#include <cstring>

namespace {

using kivcore::utility::ImmutableString;

class AnnouncingStation : public Tarn::Station {
public:
  AnnouncingStation(const ImmutableString& inStationID, const char* inWhat) : Tarn::Station(inStationID), mWhat(inWhat) {}
  ~AnnouncingStation() override {
    std::printf("%s station deleted\n", mWhat);
    std::fflush(stdout);
  }

private:
  const char* mWhat;
};

// Mode "late" reaches the registry from a static object's destructor. It was
// constructed during this program's static initialization, before main and
// so before the registry, which is made on its first use inside main. Static
// objects are destroyed in the reverse order of their construction, so this
// one goes after the registry: the lookup gets an empty map of its own and a
// diagnostic, not a destroyed map.
struct LateUser {
  bool mArmed = false;
  ImmutableString mStationID;
  ~LateUser() {
    if (!mArmed) return;
    const bool found = Tarn::StationRegistry::FindStation(mStationID) != nullptr;
    std::printf("late lookup %s\n", found ? "found a station" : "found nothing");
  }
} sLateUser;
// Mode "violation" makes the last Terminate from a static object's
// destructor, after a contract dialog that threw, with a station still
// retained. By then this thread's thread_local objects with destructors
// are gone; the leftover report goes through ThrowError all the same, and
// must name no violation.
struct LateTerminate {
  ~LateTerminate() { Tarn::Messaging::Terminate(); }
};
}  // namespace

int main(int argc, char** argv) {
  if (argc < 2) return 1;
  if (std::strcmp(argv[1], "queued") == 0) {
    if (kivcore::threads::CurrentThreadIsMainThread()) return 2;
    const ImmutableString id = Tarn::StationRegistry::UniqueStationID();
    Tarn::StationRegistry::RegisterStation(new AnnouncingStation(id, "queued"));
    // No main thread is registered, so the disposal only queues the station.
    Tarn::StationRegistry::DisposeStation(id);
    if (Tarn::StationRegistry::FindStation(id) != nullptr) return 2;
    return 0;
  }
  if (std::strcmp(argv[1], "unterminated") == 0) {
    Tarn::Messaging::Initialize();
    Tarn::Diagnostics::SetSilentFailureReports(Tarn::Diagnostics::SilentFailureReports::kOn);
    Tarn::StationUtils::PostMessageToUIThread(Tarn::kStation_StatusBar, Tarn::ApplicationIdleMessage(), true);
    return 0;
  }
  if (std::strcmp(argv[1], "late") == 0) {
    sLateUser.mStationID = Tarn::StationRegistry::RegisterUniqueStation();
    sLateUser.mArmed = true;
    return 0;
  }
  if (std::strcmp(argv[1], "violation") == 0) {
    Tarn::Diagnostics::SetSilentFailureReports(Tarn::Diagnostics::SilentFailureReports::kOn);
    Tarn::Messaging::Initialize();
    static LateTerminate late;  // destroyed before the registry, made on the line below
    Tarn::StationUtils::RetainStation(Tarn::StationRegistry::RegisterUniqueStation());
    kivcore::debug::SetContractDialogHandler([](const char*, const char*, const char*, int) -> bool { throw 0; });
    try {
      Tarn::StationUtils::AddListener(Tarn::kStation_Idle, static_cast<Tarn::Listener*>(nullptr));
    } catch (int) {
      std::printf("the dialog threw\n");
      std::fflush(stdout);
    }
    return 0;
  }
  return 1;
}
