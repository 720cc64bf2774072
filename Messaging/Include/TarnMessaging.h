/// @file
/// The whole public API of the TarnMessaging library.
#pragma once

#include <TarnMessaging/Broadcaster.h>
#include <TarnMessaging/Diagnostics.h>
#include <TarnMessaging/IdleCountdownTimer.h>
#include <TarnMessaging/Listener.h>
#include <TarnMessaging/Message.h>
#include <TarnMessaging/MessageImpl.h>
#include <TarnMessaging/Messaging.h>
#include <TarnMessaging/NullInterfaceException.h>
#include <TarnMessaging/PostCancelToken.h>
#include <TarnMessaging/SafeListener.h>
#include <TarnMessaging/Station.h>
#include <TarnMessaging/StationIDs.h>
#include <TarnMessaging/StationRegistry.h>
#include <TarnMessaging/StationUtils.h>
#include <TarnMessaging/Subscription.h>
#include <TarnMessaging/Tracing.h>
#include <TarnMessaging/TypedStation.h>

/// @namespace Tarn
/// The messaging library's public classes and functions: messages,
/// listeners, broadcasters, stations and the idle countdown timer.
///
/// @namespace Tarn::StationRegistry
/// The process-wide registry of stations by ID, which owns every station it
/// holds. Every function may be called from any thread.
///
/// @namespace Tarn::StationUtils
/// Work on a station by its ID alone: attach and detach listeners, broadcast,
/// post to the main thread. Every function may be called from any thread.
///
/// @namespace Tarn::Messaging
/// Bringing the library up and down: counted Initialize and Terminate.
