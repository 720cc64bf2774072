// The whole public API of the TarnMessaging library.
#pragma once

#include <TarnMessaging/Broadcaster.h>
#include <TarnMessaging/IdleCountdownTimer.h>
#include <TarnMessaging/Listener.h>
#include <TarnMessaging/Message.h>
#include <TarnMessaging/MessageImpl.h>
#include <TarnMessaging/Messaging.h>
#include <TarnMessaging/NullInterfaceException.h>
#include <TarnMessaging/SafeListener.h>
#include <TarnMessaging/Station.h>
#include <TarnMessaging/StationIDs.h>
#include <TarnMessaging/StationRegistry.h>
#include <TarnMessaging/StationUtils.h>
