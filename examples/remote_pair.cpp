// Two nodes of Tarn::Remote in one process, the smallest whole use of it: one
// node exports a station, the other imports it from the first one's endpoint.
// Within one process the imported station is the exported one, so each
// message is heard twice: once as broadcast, once as it came back through a
// Unix socket. Nothing goes out a second time (an imported message is not
// exported again). Exits 0 when every message was heard both ways and none
// was reported lost.
#include <TarnMessaging.h>
#include <TarnMessaging/Remote/Node.h>
#include <TarnMessaging/Remote/WireMessage.h>

#include <kivcore/MainThread.h>

#include <chrono>
#include <cstdio>
#include <string>

#include <unistd.h>

namespace example {
struct Progress : Tarn::MessageImpl<Progress> {
  std::int32_t mDone = 0;
  std::int32_t mTotal = 0;
};
TARN_WIRE_MESSAGE(Progress, "example.progress", 1, mDone, mTotal)
}  // namespace example

// Runs the main thread's pending calls until inDone() or five seconds pass.
template <class Predicate>
bool RunUntil(Predicate inDone) {
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(5);
  const auto mainThread = kivcore::threads::GetRegisteredMainThread();
  while (!inDone() && std::chrono::steady_clock::now() < deadline) {
    if (mainThread->WaitForPendingCalls(10)) mainThread->RunPendingCalls();
  }
  return inDone();
}

int main() {
  constexpr int kCount = 100;
  Tarn::Messaging::Initialize();
  const auto station = kivcore::utility::ImmutableString::CreateStatic("example.jobs");
  Tarn::StationRegistry::RegisterStation(station, nullptr);
  const std::string pid = std::to_string(::getpid());
  bool ok = false;
  {
    Tarn::Remote::Node plugin(Tarn::Remote::NodeOptions("example-plugin-" + pid));
    Tarn::Remote::Node host(Tarn::Remote::NodeOptions("example-host-" + pid));
    unsigned importers = 0;
    int heard = 0;
    unsigned long long lost = 0;
    Tarn::Registration counted = Tarn::Subscribe<Tarn::Remote::ImportersChanged>(
        station, [&](const Tarn::Remote::ImportersChanged& inChanged) { importers = inChanged.mImporters; });
    Tarn::Registration progress =
        Tarn::Subscribe<example::Progress>(station, [&](const example::Progress&) { ++heard; });
    Tarn::Registration losses = Tarn::Subscribe<Tarn::Remote::RemoteLoss>(
        station, [&](const Tarn::Remote::RemoteLoss& inLoss) { lost += inLoss.mCount; });
    plugin.Export(station);
    host.Import(station, plugin.GetEndpoint());
    if (RunUntil([&] { return importers > 0; })) {
      for (int done = 1; done <= kCount; ++done) {
        example::Progress message;
        message.mDone = done;
        message.mTotal = kCount;
        Tarn::StationUtils::BroadcastMessage(station, message);
      }
      ok = RunUntil([&] { return heard == 2 * kCount; }) && lost == 0;
    }
    std::printf("remote pair: %d of %d messages heard (broadcast and imported), %llu reported lost\n", heard,
                2 * kCount, lost);
  }
  Tarn::Messaging::Terminate();
  return ok ? 0 : 1;
}
