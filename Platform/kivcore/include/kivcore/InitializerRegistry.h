/// @file
/// kivcore::config initializer registry: libraries enrol an init and a
/// terminate function at load time with a static InitializerRegistrar; the
/// host later runs them all. Nothing runs at load.
///
/// @code{.cpp}
///   static kivcore::config::InitializerRegistrar sRegistrar(
///       "My::Library", kivcore::config::EInitializerContextFlags(10),
///       [](const kivcore::proplist::PropList&) { return Init(); },
///       [] { Term(); }, {});
///   // host, at start-up and shutdown:
///   kivcore::config::InitializerRegistry::InitializeAll(props);
///   kivcore::config::InitializerRegistry::TerminateAll();
/// @endcode
///
/// Threading: registration and the runs are serialised by one lock, which is
/// released while init and terminate functions run. One thread at a time
/// runs InitializeAll or TerminateAll; an init or terminate function may call
/// them again on its own thread. A call on another thread waits for the run
/// under way to end, so that it does not answer before the libraries are up;
/// when that takes longer than the run-wait limit (SetRunWaitLimit), the
/// wait is reported to the error manager and the call gives up. So an init
/// function that hands work to a thread calling InitializeAll, and waits for
/// it, gets false from that thread after the limit instead of a deadlock.
#pragma once

#include <kivcore/Export.h>
#include <kivcore/PropList.h>

#include <array>
#include <chrono>
#include <functional>
#include <string>

namespace kivcore::config {

/// Context bits an initializer declares; their meaning is the host's.
enum class EInitializerContextFlags : unsigned int {};

/// Brings a library up with the host's properties; false reports failure.
using InitializerFunction = std::function<bool(const proplist::PropList&)>;
/// Brings a library down.
using TerminatorFunction = std::function<void()>;
/// Names of the initializers that must run first; unused entries are null.
using InitializerDependencies = std::array<const char*, 16>;

/// Enrols an initializer and terminator pair with the InitializerRegistry
/// for as long as it lives; usually a static object of a library.
class KIVCORE_API InitializerRegistrar {
public:
  /// Enrols the pair under inName; inDependencies lists names (null entries
  /// are unused) of initializers that must run first.
  InitializerRegistrar(const char* inName, EInitializerContextFlags inFlags, InitializerFunction inInit,
                       TerminatorFunction inTerminate, const InitializerDependencies& inDependencies);
  /// Withdraws the registration (a library being unloaded).
  ~InitializerRegistrar();
  InitializerRegistrar(const InitializerRegistrar&) = delete;
  InitializerRegistrar& operator=(const InitializerRegistrar&) = delete;

private:
  unsigned long mId;
};

/// The registry of initializers that the host runs at start-up and
/// shutdown; nothing runs at load.
class KIVCORE_API InitializerRegistry {
public:
  /// Runs every registered init not yet run, in registration order (an
  /// initializer whose named dependency is registered later waits for it).
  /// Stops at the first that returns false or throws, and returns false then;
  /// false too when initializers depend on one another in a cycle. An init
  /// function may call it: entries waiting for an init still running are left
  /// to the call that runs it, and do not count as a failure. False also when
  /// its wait for a run on another thread passed the limit.
  static bool InitializeAll(const proplist::PropList& inProperties);
  /// Runs the terminate function of every initialized entry, in reverse order.
  /// Runs none when its wait for a run on another thread passed the limit.
  static void TerminateAll();
  /// How long a call waits for a run on another thread before giving up.
  static constexpr std::chrono::milliseconds kDefaultRunWaitLimit{10000};
  /// Sets that limit, clamped to between zero and a year; returns the
  /// previous one.
  static std::chrono::milliseconds SetRunWaitLimit(std::chrono::milliseconds inLimit);
  /// Whether an initializer of this name is registered, and its flags.
  static bool IsRegistered(const std::string& inName, unsigned int* outFlags = nullptr);
};

}  // namespace kivcore::config
