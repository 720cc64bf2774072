// The library side of idle-time posts, for the idle station's broadcasts and
// for library termination. The posts themselves are declared in
// StationUtils.h; coalesced and cancellable posts need no hook elsewhere.
#pragma once

#include <TarnMessaging/Export.h>

#include <atomic>

namespace Tarn {
namespace Detail {

// True while idle-time posts wait. Relaxed: a post that happens before an
// idle broadcast is seen by it through that ordering, and a post racing the
// broadcast may go to either this broadcast or the next.
TARN_MESSAGING_LOCAL extern std::atomic<bool> sIdlePostsWaiting;

// Broadcasts the idle-time posts that wait now, in the order they were made;
// main thread, from a broadcast of the idle station that its listeners will
// hear. Posts made meanwhile wait for the next one; called from a handler of
// one of those posts, it first finishes the outer call's posts. When a
// delivery throws, the posts after it wait again, ahead of newer ones
// (putting them back takes no storage), and the exception propagates.
TARN_MESSAGING_LOCAL void RunIdlePosts();

// Frees the idle-time posts that wait, unheard; for the last Terminate.
TARN_MESSAGING_LOCAL void DropIdlePosts() noexcept;

}  // namespace Detail
}  // namespace Tarn
