/// @file
/// Tarn::PostCancelToken: a mark on posts that may be dropped together before
/// they are delivered, such as the posts meant for one document.
///
/// @code{.cpp}
///   Tarn::PostCancelToken token;                               // one per document
///   // any thread:
///   Tarn::StationUtils::PostMessageToUIThread(kStation_StatusBar, Progress(1, 2), token);
///   // any thread, when the document closes:
///   token.Cancel();   // the undelivered posts are gone and their copies freed
/// @endcode
///
/// Copies of a token are the same token. The posts carrying it share its
/// state with it, so a token may be destroyed while its posts are queued;
/// they are then delivered as usual (destroying a token does not cancel).
///
/// Threading: every member may be called from any thread. Cancel may block:
/// off the main thread it waits until a delivery of one of the token's posts
/// that runs on the main thread has returned, as RemoveListener waits for a
/// handler. On the main thread it never waits, so a handler may cancel the
/// token of the post it is handling.
#pragma once

#include <TarnMessaging/Export.h>

#include <memory>

namespace Tarn {

namespace Detail {
struct PostCancelState;
}  // namespace Detail

/// A token that posts may carry (StationUtils::PostMessageToUIThread with a
/// token), so that Cancel can drop those not yet delivered. A value: copies
/// share one state, which lives while a copy or a queued post holds it.
class TARN_MESSAGING_API PostCancelToken {
public:
  /// A new token, not cancelled. Throws std::bad_alloc when memory is out.
  PostCancelToken();
  ~PostCancelToken();
  /// Copies are the same token.
  /// @{
  PostCancelToken(const PostCancelToken& inOther) noexcept;
  PostCancelToken& operator=(const PostCancelToken& inOther) noexcept;
  /// @}

  /// Drops every post carrying this token that has not been delivered, and
  /// frees their copies on this thread, before it returns. Off the main
  /// thread, waits first for a delivery of one of them under way on the main
  /// thread; nothing carrying the token is delivered after it returns. Later
  /// posts with the token are dropped at once. Cancelling twice is harmless.
  void Cancel();

  /// Whether Cancel has been called on this token (or a copy of it).
  bool IsCancelled() const noexcept;

private:
  friend struct Detail::PostCancelState;
  std::shared_ptr<Detail::PostCancelState> mState;  // never null
};

}  // namespace Tarn
