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
/// Threading: serialised by one lock. Call Initialize on the thread that is to
/// be the main thread, and the last Terminate on it too: it runs the main
/// thread's pending calls (and their handlers) on the calling thread.
#pragma once

#include <TarnMessaging/Export.h>

namespace Tarn::Messaging {

/// Brings the library up: the first call makes the calling thread the main
/// thread and registers the well-known station IDs; later calls only count.
/// Call it on the thread that is to be the main thread.
TARN_MESSAGING_API void Initialize();
/// Undoes one Initialize. The last one deletes every station, runs the main
/// thread's pending calls (and their handlers) on the calling thread, which
/// should be the main thread, and lets the main thread go.
TARN_MESSAGING_API void Terminate();

}  // namespace Tarn::Messaging
