// The initializer registry: registrars enrol entries at load time, the host
// runs them with InitializeAll and TerminateAll.
//
// One mutex guards the entry list and the run: which thread is running
// InitializeAll or TerminateAll, and how deeply nested. It is never held
// while an init or terminate function runs, so a function may construct or
// destroy registrars (a library loaded or unloaded during start-up) and call
// InitializeAll again on its own thread. A call on another thread waits for
// the run to end, for at most the wait limit.
#include <kivcore/Error.h>
#include <kivcore/InitializerRegistry.h>

#include <algorithm>
#include <condition_variable>
#include <exception>
#include <mutex>
#include <stdexcept>
#include <thread>
#include <vector>

namespace kivcore::config {

namespace {

enum class EntryState { kRegistered, kRunning, kInitialized };

struct Entry {
  unsigned long id;
  std::string name;
  unsigned int flags;
  InitializerFunction init;
  TerminatorFunction terminate;
  std::vector<std::string> dependencies;
  EntryState state = EntryState::kRegistered;
  unsigned long initOrder = 0;  // when it was initialized, for reverse termination
};

struct Registry {
  std::mutex mutex;
  std::vector<Entry> entries;  // registration order; guarded by mutex
  unsigned long nextId = 1;    // guarded by mutex
  unsigned long nextInitOrder = 1;  // guarded by mutex
  std::thread::id runner;           // the thread running InitializeAll or TerminateAll; guarded by mutex
  int runDepth = 0;                 // its calls under way, nested ones included; guarded by mutex
  std::condition_variable runEnded;
  std::chrono::milliseconds waitLimit = InitializerRegistry::kDefaultRunWaitLimit;  // guarded by mutex
};

// Never destroyed: registrars of other modules are destroyed at their unload,
// which may come after this library's static destruction has begun.
Registry& TheRegistry() {
  static Registry* registry = new Registry;
  return *registry;
}

// Whether every dependency of inEntry that is registered has been
// initialized. A dependency that is not registered at all does not hold the
// entry back. Caller holds the registry mutex.
bool DependenciesReady(const Registry& inRegistry, const Entry& inEntry) {
  for (const std::string& dependency : inEntry.dependencies) {
    for (const Entry& other : inRegistry.entries) {
      if (other.name == dependency && other.state != EntryState::kInitialized) return false;
    }
  }
  return true;
}

// Whether every entry still waiting could run once the entries now running
// have finished: true when none waits, or when those left wait only for an
// init on this thread's stack (InitializeAll called from an init function);
// false when some wait for one another (a cycle). Caller holds the registry
// mutex.
bool OnlyWaitingForRunning(const Registry& inRegistry) {
  const std::vector<Entry>& entries = inRegistry.entries;
  std::vector<bool> willRun(entries.size());
  for (std::size_t i = 0; i < entries.size(); ++i) willRun[i] = entries[i].state != EntryState::kRegistered;
  for (bool progress = true; progress;) {
    progress = false;
    for (std::size_t i = 0; i < entries.size(); ++i) {
      if (willRun[i]) continue;
      bool ready = true;
      for (const std::string& dependency : entries[i].dependencies)
        for (std::size_t d = 0; d < entries.size() && ready; ++d)
          ready = entries[d].name != dependency || willRun[d];
      if (ready) willRun[i] = progress = true;
    }
  }
  return std::find(willRun.begin(), willRun.end(), false) == willRun.end();
}

Entry* FindById(Registry& ioRegistry, unsigned long inId) {
  for (Entry& entry : ioRegistry.entries)
    if (entry.id == inId) return &entry;
  return nullptr;
}

// Makes the calling thread the runner for its lifetime, once a run on
// another thread has ended. A wait past the limit is reported to the error
// manager and Entered() is false: an init function waiting for this thread
// would otherwise never finish, nor this call.
class RunScope {
public:
  RunScope(Registry& ioRegistry, const char* inOperation) : mRegistry(ioRegistry) {
    std::unique_lock<std::mutex> lock(ioRegistry.mutex);
    const std::thread::id self = std::this_thread::get_id();
    const std::chrono::milliseconds limit = ioRegistry.waitLimit;
    mEntered = ioRegistry.runner == self ||
               ioRegistry.runEnded.wait_for(lock, limit, [&ioRegistry] { return ioRegistry.runDepth == 0; });
    if (mEntered) {
      ioRegistry.runner = self;
      ++ioRegistry.runDepth;
      return;
    }
    lock.unlock();
    const std::string what = std::string("kivcore::config::InitializerRegistry::") + inOperation +
                             " gave up after waiting " + std::to_string(limit.count()) +
                             " ms for the run under way on another thread (an init or terminate function waiting "
                             "for this thread?)";
    ErrorManager::Get(false)->GuardedCall([&what]() -> int { throw std::runtime_error(what); });
  }
  ~RunScope() {
    if (!mEntered) return;
    std::lock_guard<std::mutex> lock(mRegistry.mutex);
    if (--mRegistry.runDepth != 0) return;
    mRegistry.runner = std::thread::id();
    mRegistry.runEnded.notify_all();
  }
  RunScope(const RunScope&) = delete;
  RunScope& operator=(const RunScope&) = delete;
  bool Entered() const noexcept { return mEntered; }

private:
  Registry& mRegistry;
  bool mEntered = false;
};

}  // namespace

InitializerRegistrar::InitializerRegistrar(const char* inName, EInitializerContextFlags inFlags,
                                           InitializerFunction inInit, TerminatorFunction inTerminate,
                                           const InitializerDependencies& inDependencies) {
  Entry entry;
  entry.name = inName != nullptr ? inName : "";
  entry.flags = static_cast<unsigned int>(inFlags);
  entry.init = std::move(inInit);
  entry.terminate = std::move(inTerminate);
  for (const char* dependency : inDependencies)
    if (dependency != nullptr) entry.dependencies.emplace_back(dependency);

  Registry& registry = TheRegistry();
  std::lock_guard<std::mutex> lock(registry.mutex);
  entry.id = mId = registry.nextId++;
  registry.entries.push_back(std::move(entry));
}

InitializerRegistrar::~InitializerRegistrar() {
  Registry& registry = TheRegistry();
  std::lock_guard<std::mutex> lock(registry.mutex);
  auto found = std::find_if(registry.entries.begin(), registry.entries.end(),
                            [this](const Entry& inEntry) { return inEntry.id == mId; });
  if (found != registry.entries.end()) registry.entries.erase(found);
}

bool InitializerRegistry::InitializeAll(const proplist::PropList& inProperties) {
  Registry& registry = TheRegistry();
  const RunScope run(registry, "InitializeAll");
  if (!run.Entered()) return false;
  for (;;) {
    unsigned long id = 0;
    InitializerFunction init;
    {
      std::lock_guard<std::mutex> lock(registry.mutex);
      for (Entry& entry : registry.entries) {
        if (entry.state != EntryState::kRegistered || !DependenciesReady(registry, entry)) continue;
        id = entry.id;
        init = entry.init;  // a copy: the entry may move or go while init runs
        entry.state = EntryState::kRunning;
        break;
      }
      // Nothing left to run now. Entries left waiting for an init still
      // running are taken up by the call running it once it has finished;
      // entries whose dependencies can never be met (a cycle) are a failure.
      if (id == 0) return OnlyWaitingForRunning(registry);
    }

    bool succeeded = false;
    try {
      succeeded = !init || init(inProperties);
    } catch (...) {
      succeeded = false;
    }

    std::lock_guard<std::mutex> lock(registry.mutex);
    Entry* entry = FindById(registry, id);
    if (entry == nullptr) {
      if (!succeeded) return false;
      continue;  // withdrawn while it ran
    }
    if (!succeeded) {
      entry->state = EntryState::kRegistered;
      return false;
    }
    entry->state = EntryState::kInitialized;
    entry->initOrder = registry.nextInitOrder++;
  }
}

void InitializerRegistry::TerminateAll() {
  Registry& registry = TheRegistry();
  const RunScope run(registry, "TerminateAll");
  if (!run.Entered()) return;
  std::exception_ptr firstFailure;
  for (;;) {
    TerminatorFunction terminate;
    {
      std::lock_guard<std::mutex> lock(registry.mutex);
      Entry* latest = nullptr;
      for (Entry& entry : registry.entries) {
        if (entry.state == EntryState::kInitialized && (latest == nullptr || entry.initOrder > latest->initOrder))
          latest = &entry;
      }
      if (latest == nullptr) break;
      latest->state = EntryState::kRegistered;
      terminate = latest->terminate;
    }
    // Every initialized entry is terminated even when one fails; the first
    // failure is reported once all have run.
    try {
      if (terminate) terminate();
    } catch (...) {
      if (!firstFailure) firstFailure = std::current_exception();
    }
  }
  if (firstFailure) std::rethrow_exception(firstFailure);
}

std::chrono::milliseconds InitializerRegistry::SetRunWaitLimit(std::chrono::milliseconds inLimit) {
  Registry& registry = TheRegistry();
  std::lock_guard<std::mutex> lock(registry.mutex);
  const std::chrono::milliseconds previous = registry.waitLimit;
  // Longer limits would overflow the clock's arithmetic in the wait.
  registry.waitLimit = std::clamp<std::chrono::milliseconds>(inLimit, std::chrono::milliseconds(0),
                                                             std::chrono::hours(24 * 365));
  return previous;
}

bool InitializerRegistry::IsRegistered(const std::string& inName, unsigned int* outFlags) {
  Registry& registry = TheRegistry();
  std::lock_guard<std::mutex> lock(registry.mutex);
  for (const Entry& entry : registry.entries) {
    if (entry.name == inName) {
      if (outFlags != nullptr) *outFlags = entry.flags;
      return true;
    }
  }
  return false;
}

}  // namespace kivcore::config
