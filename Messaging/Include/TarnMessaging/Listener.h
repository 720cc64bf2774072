/// @file
/// Tarn::Listener: the base of every object that receives messages from a
/// Tarn::Broadcaster by plain pointer or through a weak pointer.
///
/// @code{.cpp}
///   class StatusLine : public Tarn::Listener {
///     void ListenToMessage(const Tarn::Message& inMessage) override {
///       if (inMessage.GetMessageID() == Progress::StaticMessageID()) Draw(static_cast<const Progress&>(inMessage));
///     }
///   };
///   StatusLine line;
///   broadcaster.AddListener(&line);   // detached again by either destructor
/// @endcode
///
/// A listener remembers every broadcaster that holds it by plain pointer, so
/// that whichever of the two is destroyed first detaches itself from the
/// other. Listeners held through weak pointers keep no such link.
///
/// Threading: handlers run on the main thread. The listener's destructor
/// detaches it from its broadcasters; on a thread other than the main thread
/// that waits until a delivery to this listener that is running on the main
/// thread has returned (never on the main thread). Because the derived part is
/// already gone by the time ~Listener runs, a listener that may be destroyed
/// on a worker while the main thread broadcasts to it should detach itself in
/// its own destructor. StopListening/StartListening may be called from any
/// thread and take effect from the next delivery.
#pragma once

#include <TarnMessaging/Export.h>

#include <kivcore/SmallBlockAllocator.h>

#include <atomic>
#include <list>

namespace Tarn {

class Broadcaster;
class Message;

/// The base of every object that receives messages from a Broadcaster by
/// plain pointer or through a weak pointer. Handlers run on the main thread.
/// A listener held by plain pointer and its broadcaster detach from each
/// other when either is destroyed; off the main thread the listener's
/// destructor waits for a delivery to it in progress on the main thread.
class TARN_MESSAGING_API Listener {
public:
  /// A listener attached to nothing, listening.
  Listener() noexcept;
  /// The copy is attached to no broadcaster; it keeps inOther's listen state.
  Listener(const Listener& inOther) noexcept;
  /// Copies the listen state only; attachments stay as they are.
  Listener& operator=(const Listener& inOther) noexcept;
  virtual ~Listener();

  /// The entry broadcasters call: forwards to DispatchMessage, whatever the
  /// listen state.
  void ProcessMessage(const Message& inMessage) { DispatchMessage(inMessage); }

protected:
  /// Every delivery passes here; the default calls ListenToMessage.
  virtual void DispatchMessage(const Message& inMessage);

public:
  /// The handler. The message is valid for the duration of the call only.
  virtual void ListenToMessage(const Message& inMessage) = 0;

  /// True when inBroadcaster holds this listener by plain pointer, as the
  /// listener's own records say (the broadcaster is not asked).
  bool HasBroadcaster(Broadcaster* inBroadcaster) const;

  /// A stopped listener is skipped by broadcasters that hold it by plain
  /// pointer but stays registered; weak-pointer registrations ignore it.
  /// Any thread; takes effect from the next delivery.
  /// @{
  void StartListening() noexcept { mListening.store(true, std::memory_order_relaxed); }
  void StopListening() noexcept { mListening.store(false, std::memory_order_relaxed); }
  bool IsListening() const noexcept { return mListening.load(std::memory_order_relaxed); }
  bool GetListenState() const noexcept { return IsListening(); }
  /// @}

private:
  friend class Broadcaster;
  using BroadcasterList = std::list<Broadcaster*, kivcore::utility::SmallBlockAllocator::STLAllocator<Broadcaster*>>;

  // For Broadcaster only: record / forget a plain-pointer registration.
  // RemoveBroadcaster drops one record, so that a removal whose back-link
  // update lands after the listener was added again (a handler re-adding
  // itself while a worker removes it) leaves the new registration's record.
  TARN_MESSAGING_LOCAL void AddBroadcaster(Broadcaster* inBroadcaster);
  TARN_MESSAGING_LOCAL void RemoveBroadcaster(Broadcaster* inBroadcaster) noexcept;
  // Drops every record of a broadcaster that is being destroyed.
  TARN_MESSAGING_LOCAL void ForgetBroadcaster(Broadcaster* inBroadcaster) noexcept;

  // Broadcasters holding this listener by plain pointer, in attach order.
  // Guarded by mBroadcastersBusy: a broadcaster on another thread (one being
  // destroyed, say) may update it while this listener is attached elsewhere.
  BroadcasterList mBroadcasters;
  mutable std::atomic<bool> mBroadcastersBusy{false};
  std::atomic<bool> mListening{true};  // read by the delivering (main) thread
};

}  // namespace Tarn
