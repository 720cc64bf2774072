/// @file
/// Tarn::StationUtils: work on a station by its ID alone.
///
/// @code{.cpp}
///   StationUtils::AddListener(kStation_StatusBar, &statusLine);
///   StationUtils::BroadcastMessage(kStation_StatusBar, Progress(1, 2)); // main thread
///   StationUtils::PostMessageToUIThread(kStation_StatusBar, Progress(2, 2), false); // any thread
///   StationUtils::FlushPostedMessagesOnUIThread();                     // main thread
///   StationUtils::PostCoalescedMessageToUIThread(kStation_StatusBar, Progress(3, 4)); // latest wins
///   StationUtils::PostMessageToUIThread(kStation_StatusBar, Progress(4, 4), token);   // token.Cancel() drops it
///   StationUtils::PostMessageAtIdleTime(kStation_StatusBar, Tidy());                  // with the next idle broadcast
/// @endcode
///
/// Each function that touches a station retains it from the registry for the
/// length of the call and releases it afterwards. An ID that is not
/// registered makes every function a no-op (HasListeners: false); with
/// silent-failure reports on (Diagnostics.h), every function but
/// HasListeners, ReleaseStation and FlushPostedMessagesOnUIThread reports it
/// once per call site; a post checks the ID when it is made (its copy is
/// still queued, and dropped if no station is registered at its delivery).
///
/// Threading: every function may be called from any thread. BroadcastMessage
/// delivers only on the main thread; elsewhere it does nothing (it does not
/// even look the station up, and reports the drop when silent-failure reports
/// are on), which is what PostMessageToUIThread is for. RemoveListener may block as
/// Broadcaster::RemoveListener does. A post is delivered when the main thread
/// runs its pending calls, to the listeners attached at that moment, unless
/// its station is gone or stopped then. Each post is delivered at most once,
/// and one thread's posts in the order it made them, also across a flush
/// made from inside a handler; besides a gone or stopped station, only the
/// last Tarn::Messaging::Terminate drops a post (those still queued then).
/// The other kinds of post follow the same rules, except what their own
/// declarations say: a coalesced post may be replaced by a later one, a
/// cancellable post is dropped by its token, and an idle-time post waits for
/// the idle station's next broadcast instead of the next run.
///
/// Queue and storage: posts wait in the main thread's queue of calls
/// (kivcore/MainThread.h), which has no bound: each keeps its copy of the
/// message until the main thread runs it. Workers that post while the main
/// thread runs nothing hold memory for every post (4 million posts of a
/// small message: 370 to 550 MiB, by its size). A queue longer than its
/// high-water mark (kivcore::threads::SetPendingCallHighWaterMark; 1,048,576
/// calls unless set) is reported once per burst through kivcore's
/// ThrowError, with the key kivcore::threads::kPendingCallHighWaterKey
/// followed by the count and the posts queued by station and message type,
/// on the posting thread that passed the mark. Once the main thread has run a
/// burst, the queue's storage and the small blocks of the copies go back.
///
/// Between lives: a post made while the library is down (after the last
/// Tarn::Messaging::Terminate, before the next Initialize) is queued all the
/// same, with no main thread to run it. It waits, holding its copy, for the
/// library's next life, and is delivered when the new main thread runs its
/// calls, to the station registered under its ID then (a well-known station
/// is there again); with none, it is dropped unheard and unreported.
///
/// Misuse (a null or expired listener, an empty station ID in SwitchStation)
/// is reported through the contract-check procedure before the station is
/// looked up; when the report returns, the call goes on harmlessly.
#pragma once

#include <TarnMessaging/Export.h>
#include <TarnMessaging/Message.h>
#include <TarnMessaging/PostCancelToken.h>
#include <TarnMessaging/SafeListener.h>

#include <kivcore/ImmutableString.h>

#include <boost/weak_ptr.hpp>

#include <cstdint>
#include <memory>

namespace Tarn {

class Listener;

namespace StationUtils {

using kivcore::utility::ImmutableString;

/// Attaches inListener to the station, as Broadcaster::AddListener does; a
/// station ID that is not registered makes it a no-op.
/// Preconditions: inListener != NULL, or inListener.lock() != NULL.
/// @{
TARN_MESSAGING_API void AddListener(const ImmutableString& inStationID, const boost::weak_ptr<Listener>& inListener);
TARN_MESSAGING_API void AddListener(const ImmutableString& inStationID, const std::weak_ptr<Listener>& inListener);
TARN_MESSAGING_API void AddListener(const ImmutableString& inStationID, Listener* inListener);
TARN_MESSAGING_API void AddListener(const ImmutableString& inStationID, InterfaceRef<ISafeListener> inListener);
/// @}

/// Detaches inListener from the station; may block off the main thread as
/// Broadcaster::RemoveListener does.
/// Preconditions: inListener.lock() != NULL, or inListener != NULL.
/// @{
TARN_MESSAGING_API void RemoveListener(const ImmutableString& inStationID, const boost::weak_ptr<Listener>& inListener);
TARN_MESSAGING_API void RemoveListener(const ImmutableString& inStationID, const std::weak_ptr<Listener>& inListener);
TARN_MESSAGING_API void RemoveListener(const ImmutableString& inStationID, Listener* inListener);
TARN_MESSAGING_API void RemoveListener(const ImmutableString& inStationID, InterfaceRef<ISafeListener> inListener);
/// @}

// BroadcastMessage(inStationID, inMessage) is declared in Message.h: delivers
// synchronously on the main thread; nothing elsewhere.

/// Whether the station has any registration; false when unregistered.
TARN_MESSAGING_API bool HasListeners(const ImmutableString& inStationID);

/// A retain that stands between calls: keeps the station (its listeners and
/// broadcasting state) from a pending disposal until the matching release.
/// @{
TARN_MESSAGING_API void RetainStation(const ImmutableString& inStationID);
TARN_MESSAGING_API void ReleaseStation(const ImmutableString& inStationID);
/// @}

/// While stopped, broadcasts on the station are dropped (not kept for later).
/// @{
TARN_MESSAGING_API void StartBroadcasting(const ImmutableString& inStationID);
TARN_MESSAGING_API void StopBroadcasting(const ImmutableString& inStationID);
/// @}

/// Moves a plain-pointer listener: removes it from inFromStationID, then adds
/// it to inToStationID (not atomic: in between it is on neither).
/// Preconditions: !inFromStationID.empty(), !inToStationID.empty(),
/// inListener != NULL.
TARN_MESSAGING_API void SwitchStation(const ImmutableString& inFromStationID, const ImmutableString& inToStationID,
                                      Listener* inListener);

/// On the main thread with inForceAsync false: broadcasts at once, with no
/// copy and no allocation. Otherwise queues a copy of the message for the main
/// thread (one small-block allocation; std::bad_alloc when storage is out, and
/// nothing is queued then). Once queued, the post stands: a host loop that
/// fails to schedule its run is reported to kivcore's error manager, not to
/// the poster. inMessage may be destroyed as soon as this returns.
TARN_MESSAGING_API void PostMessageToUIThread(const ImmutableString& inStationID, const Message& inMessage,
                                              bool inForceAsync);
/// Coalesced post: queues a copy as PostMessageToUIThread does (also on the
/// main thread), unless a post with the same key is still queued; then that
/// post's copy is replaced by this one, which keeps the earlier place in the
/// queue. The key is the station and the message's type, or the station and
/// inCallerKey (a space of its own: caller keys never meet type keys). A post
/// is queued again once its delivery has begun, so the copy delivered is the
/// newest when it is delivered, and none is delivered twice. Throws
/// std::bad_alloc when storage is out; the queued post, if any, stays as it
/// was then.
/// @{
TARN_MESSAGING_API void PostCoalescedMessageToUIThread(const ImmutableString& inStationID, const Message& inMessage);
TARN_MESSAGING_API void PostCoalescedMessageToUIThread(const ImmutableString& inStationID, const Message& inMessage,
                                                       std::uint64_t inCallerKey);
/// @}

/// Cancellable post: queues a copy (also on the main thread) that
/// inToken.Cancel() drops, and frees, for as long as it is undelivered. With
/// a token already cancelled, copies nothing and queues nothing. Throws
/// std::bad_alloc when storage is out; nothing is queued then.
TARN_MESSAGING_API void PostMessageToUIThread(const ImmutableString& inStationID, const Message& inMessage,
                                              const PostCancelToken& inToken);

/// Idle-time post: keeps a copy until the next broadcast on kStation_Idle
/// that its listeners hear (on the main thread, the station broadcasting),
/// and broadcasts the copy on inStationID just before them; never earlier,
/// and not by FlushPostedMessagesOnUIThread. Posts made meanwhile, from its
/// handlers too, wait for the next idle broadcast. The last
/// Tarn::Messaging::Terminate drops and frees those still waiting. Throws
/// std::bad_alloc when storage is out; nothing is kept then.
TARN_MESSAGING_API void PostMessageAtIdleTime(const ImmutableString& inStationID, const Message& inMessage);

/// Runs every pending call of the main thread now. From inside a handler of
/// a posted message, first runs the posts the outer run has not reached. Does
/// nothing while no main thread is registered.
/// Precondition: called on the main thread; otherwise a contract violation,
/// and nothing runs: the posts stay queued for the main thread.
TARN_MESSAGING_API void FlushPostedMessagesOnUIThread();

}  // namespace StationUtils
}  // namespace Tarn
