/// @file
/// Tarn::Messaging: bringing the library up and down.
///
/// @code{.cpp}
///   int main() {
///     Tarn::Messaging::Initialize();   // this thread becomes the main thread
///     ...
///     Tarn::Messaging::Terminate();    // deletes every station, runs pending calls
///   }
/// @endcode
///
/// Both are counted: several clients may each initialize and terminate, as
/// long as the calls pair. The library also enrols them with kivcore's
/// initializer registry under "Tarn::Messaging", so a host may leave both to
/// InitializerRegistry::InitializeAll / TerminateAll instead.
///
/// Threading: the counts are kept under one lock, which is never held while
/// host code runs. Call Initialize on the thread that is to be the main
/// thread, and the last Terminate on it too: it runs the main thread's pending
/// calls (and their handlers) on the calling thread. While the last Terminate
/// runs its steps (station destructors, the calls still queued, the reports
/// of what it leaves behind), an Initialize on the same thread (from a queued
/// call) goes ahead at once; one on another thread waits for those steps to
/// end, at most 10 seconds, and past that is reported through the
/// contract-check procedure and brings nothing up (a queued call that waits
/// for that very thread would otherwise never return).
#pragma once

#include <TarnMessaging/Export.h>

namespace Tarn::Messaging {

/// Brings the library up: the first call makes the calling thread the main
/// thread and registers the well-known station IDs; later calls only count.
/// Call it on the thread that is to be the main thread.
TARN_MESSAGING_API void Initialize();
/// Undoes one Initialize. The last one deletes every station, runs the main
/// thread's pending calls (and their handlers) on the calling thread, which
/// should be the main thread, and lets the main thread go. A Terminate with no
/// Initialize left to undo is reported through the contract-check procedure
/// and does nothing.
TARN_MESSAGING_API void Terminate();

}  // namespace Tarn::Messaging
