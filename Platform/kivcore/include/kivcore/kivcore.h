/// @file
/// The whole kivcore API: strings, small-block allocation, locks and gates,
/// main-thread services, the initializer registry, error reporting and the
/// debug hooks.
#pragma once

#include <kivcore/Debug.h>
#include <kivcore/Error.h>
#include <kivcore/Gate.h>
#include <kivcore/Guid.h>
#include <kivcore/ImmutableString.h>
#include <kivcore/InitializerRegistry.h>
#include <kivcore/MainThread.h>
#include <kivcore/PropList.h>
#include <kivcore/RecursiveMutex.h>
#include <kivcore/SmallBlockAllocator.h>

/// @namespace kivcore
/// The core utility library.
///
/// @namespace kivcore::utility
/// Interned strings, identifiers and small-block allocation.
///
/// @namespace kivcore::threads
/// Locks, gates and the main thread's call queue.
///
/// @namespace kivcore::config
/// Error reporting and the initializer registry.
///
/// @namespace kivcore::debug
/// Contract-violation dialogs and debugger queries, through hooks.
///
/// @namespace kivcore::proplist
/// The property lists handed to initializers.
