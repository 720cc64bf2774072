#include "DemoHost.h"

#include "DemoListeners.h"
#include "DemoMessages.h"
#include "MeteredStation.h"
#include "StatusBar.h"
#include "TextFormat.h"
#include "Workers.h"

#include <TarnMessaging.h>
#include <TarnMessaging/Integration/AsioEventLoop.h>

#include <kivcore/MainThread.h>
#include <kivcore/SmallBlockAllocator.h>

#include <boost/asio/executor_work_guard.hpp>
#include <boost/asio/io_context.hpp>
#include <boost/make_shared.hpp>
#include <boost/shared_ptr.hpp>
#include <boost/weak_ptr.hpp>

#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <functional>
#include <memory>
#include <string>
#include <thread>
#include <vector>

namespace tarn_demo {

namespace {

constexpr std::int64_t kNanoSecondsPerMilliSecond = 1000000;

// Nearest-rank percentile of inSamples (reordered); 0 when empty.
std::uint32_t Percentile(std::vector<std::uint32_t>& ioSamples, unsigned inPercent) {
  if (ioSamples.empty()) return 0;
  std::size_t rank = (ioSamples.size() * inPercent + 99) / 100;
  rank = std::max<std::size_t>(rank, 1);
  const auto at = ioSamples.begin() + static_cast<std::ptrdiff_t>(rank - 1);
  std::nth_element(ioSamples.begin(), at, ioSamples.end());
  return *at;
}

DisplayMode ChooseDisplay(const DemoOptions& inOptions) {
  if (inOptions.mQuiet || inOptions.mJson) return DisplayMode::kNone;
  return isatty(STDOUT_FILENO) ? DisplayMode::kLiveLine : DisplayMode::kPlainLines;
}

enum class SuspendStage { kRunning, kSuspended, kResumed };

// The application between Initialize and Terminate: its listeners, its
// workers and its event loop. Everything it holds of the library is gone
// when it is destroyed.
class DemoApplication {
public:
  DemoApplication(const DemoOptions& inOptions, const DropLedger& inLedger);
  DemoApplication(const DemoApplication&) = delete;
  DemoApplication& operator=(const DemoApplication&) = delete;

  // Runs the workers and the event loop to the last autosave, shuts down,
  // and fills in ioSummary's figures.
  void Run(DemoSummary& ioSummary);

private:
  void AttachListeners();
  void StartWorkers();
  // False when the run stalled.
  bool RunEventLoop();
  void SuspendOrResume(std::int64_t inNow);
  void OnAutosave();
  void ShutDown(DemoSummary& ioSummary);
  void CollectFigures(DemoSummary& ioSummary);

  const DemoOptions mOptions;
  const DropLedger& mLedger;
  // Held for the event loop; let go with this object, before Terminate drops
  // the library's own hold on the main thread.
  const boost::shared_ptr<kivcore::threads::AsyncEventLoopAdaptor> mMainThread;
  const std::vector<std::uint32_t> mPerWorker;  // messages of each worker

  // The listeners, one of each kind.
  StatusBar mStatusBar;                                // plain pointer
  ProgressTally mTally;                                // typed subscription
  Tarn::Registration mTallyRegistration;
  const std::shared_ptr<AutosaveScheduler> mAutosave;  // std::weak_ptr
  LifecycleListener* const mLifecycleObject;           // counted safe listener,
  const Tarn::ISafeListenerRef mLifecycle;             //   owned by this reference
  const std::shared_ptr<DetachProbe> mProbe;
  std::unique_ptr<DetachingListener> mDoomed;  // plain pointer, handed to worker 0

  ProgressMeter mMeter;  // plain pointer, on a private station of coalesced updates
  WorkBoard mBoard;
  std::vector<std::thread> mWorkers;
  std::vector<std::string> mWorkerErrors;  // each written by its worker, read after the join

  // The run's progress; main thread.
  const std::int64_t mStallLimit;  // nanoseconds without any progress before the run is abandoned
  std::uint32_t mBurst = 0;        // the burst running, or kBursts once all are saved
  std::int64_t mBurstStartedAt = 0;
  std::int64_t mBusyNanoSeconds = 0;
  SuspendStage mStage = SuspendStage::kRunning;
  std::int64_t mResumeAt = 0;
};

std::vector<std::uint32_t> ShareOut(std::uint64_t inMessages, std::uint32_t inWorkers) {
  std::vector<std::uint32_t> shares(inWorkers);
  for (std::uint32_t w = 0; w < inWorkers; ++w) {
    shares[w] = static_cast<std::uint32_t>(inMessages / inWorkers + (w < inMessages % inWorkers ? 1 : 0));
  }
  return shares;
}

DemoApplication::DemoApplication(const DemoOptions& inOptions, const DropLedger& inLedger)
    : mOptions(inOptions),
      mLedger(inLedger),
      mMainThread(kivcore::threads::GetRegisteredMainThread()),
      mPerWorker(ShareOut(inOptions.mMessages, inOptions.mWorkers)),
      mStatusBar(ChooseDisplay(inOptions), mPerWorker, inLedger),
      mAutosave(std::make_shared<AutosaveScheduler>(inOptions.mIdleMilliSeconds)),
      mLifecycleObject(new LifecycleListener),
      mLifecycle(mLifecycleObject),
      mProbe(std::make_shared<DetachProbe>()),
      mDoomed(std::make_unique<DetachingListener>(mProbe)),
      mMeter(mPerWorker),
      mBoard(inOptions.mWorkers, mMeter.StationID()),
      mWorkerErrors(inOptions.mWorkers),
      // Nothing may take longer than the autosave's quiet time plus a
      // generous margin; a stall is reported rather than waited out.
      mStallLimit((10000 + 3 * std::int64_t{inOptions.mIdleMilliSeconds}) * kNanoSecondsPerMilliSecond) {}

void DemoApplication::Run(DemoSummary& ioSummary) {
  AttachListeners();
  StartWorkers();
  if (!RunEventLoop()) {
    ioSummary.mFaults.push_back("the run stalled: nothing happened for " +
                                std::to_string(mStallLimit / kNanoSecondsPerMilliSecond) + " ms");
  }
  ShutDown(ioSummary);
  CollectFigures(ioSummary);
}

void DemoApplication::AttachListeners() {
  Tarn::StationUtils::AddListener(Tarn::kStation_StatusBar, &mStatusBar);
  mTallyRegistration = Tarn::Subscribe<ProgressMessage>(Tarn::kStation_StatusBar, &mTally, &ProgressTally::OnProgress);
  mAutosave->Attach(mAutosave);
  Tarn::StationUtils::AddListener(Tarn::kStation_AppSuspend, mLifecycle);
  Tarn::StationUtils::AddListener(Tarn::kStation_AppResume, mLifecycle);
  Tarn::StationUtils::AddListener(Tarn::kStation_StatusBar, mDoomed.get());
  mAutosave->SetOnAutosave([this] { OnAutosave(); });
}

void DemoApplication::StartWorkers() {
  const std::chrono::milliseconds waitLimit(mStallLimit / kNanoSecondsPerMilliSecond + 1000);
  mBurstStartedAt = SteadyNanoSeconds();
  // Armed here as well as by every progress message, so that a burst with
  // nothing to post still ends in an autosave.
  mAutosave->Rearm();
  mWorkers.reserve(mOptions.mWorkers);
  for (std::uint32_t w = 0; w < mOptions.mWorkers; ++w) {
    mWorkers.emplace_back(RunWorker, w, mPerWorker[w], std::ref(mBoard), w == 0 ? std::move(mDoomed) : nullptr,
                          waitLimit, std::ref(mWorkerErrors[w]));
  }
}

// Each autosave ends a burst once every worker has finished it; an autosave
// while a worker still works (it paused for longer than the quiet time)
// re-arms the timer and waits for the rest.
void DemoApplication::OnAutosave() {
  const std::string number = "autosave " + std::to_string(mAutosave->Autosaves());
  if (!mBoard.BurstFinishedByAll(mBurst)) {
    mStatusBar.Note(number + " (a worker paused mid-burst)");
    mAutosave->Rearm();
    return;
  }
  mBusyNanoSeconds += std::max<std::int64_t>(0, mStatusBar.LastDeliveryAt() - mBurstStartedAt);
  mStatusBar.Note(number + " after burst " + std::to_string(mBurst + 1) + " of " + std::to_string(kBursts));
  if (++mBurst == kBursts) return;
  mBurstStartedAt = SteadyNanoSeconds();
  mAutosave->Rearm();
  mBoard.OpenBurst(mBurst);
}

// The event loop: an io_context that runs what the workers posted, and whose
// integration tells the application it is idle when nothing is pending, at
// most every idle interval. After each handler, or a millisecond without one,
// the loop reports progress to the workers and checks the suspension and the
// stall limit. Ends once the last burst is saved and the application is not
// suspended.
bool DemoApplication::RunEventLoop() {
  boost::asio::io_context context;
  Tarn::Integration::AsioEventLoop messaging(context);
  messaging.SetIdleInterval(std::chrono::milliseconds(std::clamp<std::uint32_t>(mOptions.mIdleMilliSeconds / 4, 1, 5)));
  const auto work = boost::asio::make_work_guard(context);
  std::uint64_t lastProgress = 0;
  std::int64_t lastProgressAt = SteadyNanoSeconds();
  while (mBurst < kBursts || mStage == SuspendStage::kSuspended) {
    context.run_one_for(std::chrono::milliseconds(1));
    mBoard.NoteHandled(mStatusBar.Delivered() + mLedger.mDroppedWhileStopped);

    const std::int64_t now = SteadyNanoSeconds();
    SuspendOrResume(now);

    // Autosaves do not count as progress: a burst that never ends would
    // re-arm the timer for ever.
    const std::uint64_t progress = mBoard.Posted() + mStatusBar.Delivered() + mLedger.mDroppedWhileStopped + mBurst;
    if (progress != lastProgress) {
      lastProgress = progress;
      lastProgressAt = now;
    } else if (now - lastProgressAt > mStallLimit) {
      mBoard.Abandon();
      return false;
    }
  }
  return true;
}

// Halfway through the posts the application is suspended for a moment: the
// status bar stops broadcasting, and what reaches it meanwhile is dropped.
void DemoApplication::SuspendOrResume(std::int64_t inNow) {
  if (mStage == SuspendStage::kRunning && mBoard.Posted() >= (mOptions.mMessages + 1) / 2) {
    mStatusBar.Note("halfway: suspended; the status bar drops what arrives until the resume");
    Tarn::StationUtils::BroadcastMessage(Tarn::kStation_AppSuspend, SuspendMessage());
    mStage = SuspendStage::kSuspended;
    mResumeAt = inNow + std::clamp<std::int64_t>(mOptions.mIdleMilliSeconds / 40, 1, 5) * kNanoSecondsPerMilliSecond;
  } else if (mStage == SuspendStage::kSuspended && inNow >= mResumeAt) {
    Tarn::StationUtils::BroadcastMessage(Tarn::kStation_AppResume, ResumeMessage());
    mStatusBar.Note("resumed after " + WithSeparators(mLedger.mDroppedWhileStopped) + " messages dropped");
    mStage = SuspendStage::kResumed;
  }
}

void DemoApplication::ShutDown(DemoSummary& ioSummary) {
  if (mStage == SuspendStage::kSuspended) {
    Tarn::StationUtils::BroadcastMessage(Tarn::kStation_AppResume, ResumeMessage());
    mStage = SuspendStage::kResumed;
  }
  for (std::thread& worker : mWorkers) worker.join();
  for (const std::string& error : mWorkerErrors) {
    if (!error.empty()) ioSummary.mFaults.push_back(error);
  }
  // Whatever the last burst posted after its autosave is delivered now.
  while (mMainThread->PendingCallCount() != 0) mMainThread->RunPendingCalls();
  mStatusBar.Finish();

  Tarn::StationUtils::RemoveListener(Tarn::kStation_StatusBar, &mStatusBar);
  mTallyRegistration.Reset();
  mAutosave->Detach(mAutosave);
  Tarn::StationUtils::RemoveListener(Tarn::kStation_AppSuspend, mLifecycle);
  Tarn::StationUtils::RemoveListener(Tarn::kStation_AppResume, mLifecycle);
}

void DemoApplication::CollectFigures(DemoSummary& ioSummary) {
  DemoSummary& s = ioSummary;
  s.mPosted = mBoard.Posted();
  s.mMeterPosted = mBoard.MeterPosted();
  s.mMeterDelivered = mMeter.Delivered();
  s.mMeterRegressions = mMeter.Regressions();
  s.mMeterUnfinished = mMeter.Unfinished();
  s.mDelivered = mStatusBar.Delivered();
  s.mDroppedByDesign = mLedger.mDroppedWhileStopped;
  s.mArrivedWhileBroadcasting = mLedger.mArrivedWhileBroadcasting;
  s.mDuplicates = mStatusBar.Duplicates();
  s.mStrays = mStatusBar.Strays();
  s.mTypedHeard = mTally.Heard();
  s.mStdWeakHeard = mAutosave->ProgressHeard();
  s.mDetachedListenerHeard = mProbe->mHeard.load();
  s.mDetachViolations = mProbe->mViolations.load();
  s.mDetachedListenerGone = mProbe->mDestroyed.load();
  s.mDetachedMidDelivery = mProbe->mDestroyedMidDelivery.load();
  s.mSuspends = mLifecycleObject->Suspends();
  s.mResumes = mLifecycleObject->Resumes();
  s.mAutosaves = mAutosave->Autosaves();
  std::vector<std::uint32_t>& latencies = mStatusBar.Latencies();
  s.mLatencyMax = latencies.empty() ? 0 : *std::max_element(latencies.begin(), latencies.end());
  s.mLatencyP99 = Percentile(latencies, 99);
  s.mLatencyP50 = Percentile(latencies, 50);
  s.mBusySeconds = static_cast<double>(mBusyNanoSeconds) / 1e9;
  s.mMessagesPerSecond =
      mBusyNanoSeconds > 0 ? static_cast<double>(s.mDelivered) * 1e9 / static_cast<double>(mBusyNanoSeconds) : 0;
}

}  // namespace

namespace {

// The registry as it stands, one station a line.
void DumpStations(std::FILE* inStream) {
  const Tarn::StationRegistry::StationSnapshotList stations = Tarn::StationRegistry::Snapshot();
  std::fprintf(inStream, "Stations at the end of the run: %zu\n", stations.size());
  std::fprintf(inStream, "  %-40s %-17s %8s %10s\n", "station", "state", "retains", "listeners");
  for (const Tarn::StationRegistry::StationSnapshot& station : stations) {
    std::fprintf(inStream, "  %-40s %-17s %8u %10zu\n", station.mStationID.c_str(), Tarn::StationRegistry::ToString(station.mState),
                 static_cast<unsigned>(station.mRetainCount), station.mListenerCount);
  }
}

}  // namespace

DemoSummary RunDemo(const DemoOptions& inOptions) {
  DemoSummary summary;
  summary.mWorkers = inOptions.mWorkers;
  summary.mMessages = inOptions.mMessages;
  summary.mIdleMilliSeconds = inOptions.mIdleMilliSeconds;
  summary.mBursts = kBursts;
  const std::int64_t wallStart = SteadyNanoSeconds();

  // Taken before anything of the library is made, so that whatever the run
  // leaves behind shows as a difference.
  const std::size_t blocksBefore = kivcore::utility::SmallBlockAllocator::GetStatistics().blocksInUse;

  DropLedger ledger;
  InstallMeteredStatusBar(&ledger);
  Tarn::Messaging::Initialize();  // this thread is the main thread from here on
  if (!StatusBarIsMetered()) summary.mFaults.push_back("the status-bar station is not the metered one");
  {
    DemoApplication application(inOptions, ledger);
    application.Run(summary);
    if (inOptions.mDumpStations) DumpStations(inOptions.mJson ? stderr : stdout);
  }
  Tarn::Messaging::Terminate();

  const std::size_t blocksAfter = kivcore::utility::SmallBlockAllocator::GetStatistics().blocksInUse;
  summary.mLeakedBlocks = static_cast<std::int64_t>(blocksAfter) - static_cast<std::int64_t>(blocksBefore);
  summary.mWallSeconds = static_cast<double>(SteadyNanoSeconds() - wallStart) / 1e9;
  return summary;
}

}  // namespace tarn_demo
