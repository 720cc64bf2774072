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
/// detaches it from its broadcasters and returns only when no delivery to
/// this listener runs on another thread (it never waits for one on its own
/// thread); it allocates nothing. A broadcaster destroyed at
/// the same time on another thread is safe: whichever goes first unlinks the
/// other. Because the derived part is already gone by the time ~Listener
/// runs, a listener that may be destroyed on a worker while the main thread
/// delivers to it calls DetachFromBroadcasters() in its own destructor, as
/// Station does. StopListening/StartListening may be called from any thread
/// and take effect from the next delivery.
#pragma once

#include <TarnMessaging/Export.h>

#include <kivcore/SmallBlockAllocator.h>

#include <atomic>
#include <cstdint>
#include <list>
#include <memory>

namespace Tarn {

class Broadcaster;
class BroadcasterCore;
class Message;

/// The base of every object that receives messages from a Broadcaster by
/// plain pointer or through a weak pointer. Handlers run on the main thread.
/// A listener held by plain pointer and its broadcaster detach from each
/// other when either is destroyed; the listener's destructor waits for a
/// delivery to it in progress on another thread.
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

protected:
  /// Detaches this listener from every broadcaster that holds it by plain
  /// pointer, and returns only when no delivery to it runs on another
  /// thread. ~Listener does this too, but by then the derived part
  /// is gone: a class whose handler may still be called while it is destroyed
  /// on another thread calls this first in its own destructor, while whole.
  /// Allocates nothing and throws nothing.
  void DetachFromBroadcasters() noexcept;

  /// For a listener that hears messages of one type only (a typed
  /// subscription): broadcasters pass it over for every other type, before
  /// any call or trace, so that a broadcast reaches only the listeners of its
  /// type. Call it in the constructor, before the listener is attached;
  /// inMessageID 0 (the default) hears every type.
  void HearOnly(std::uint32_t inMessageID) noexcept { mHearsOnly = inMessageID; }

private:
  friend class BroadcasterCore;
  // One plain-pointer registration: the broadcaster (compared, never
  // followed) and a weak link to its core (locked to detach).
  struct BackLink {
    Broadcaster* mBroadcaster;
    std::weak_ptr<BroadcasterCore> mCore;
  };
  using BackLinkList = std::list<BackLink, kivcore::utility::SmallBlockAllocator::STLAllocator<BackLink>>;

  // For BroadcasterCore only, with the core's lock held: at most one link
  // per core, so the list is exact.
  TARN_MESSAGING_LOCAL void AddBroadcaster(Broadcaster* inBroadcaster, const std::weak_ptr<BroadcasterCore>& inCore);
  TARN_MESSAGING_LOCAL void RemoveBroadcaster(const std::weak_ptr<BroadcasterCore>& inCore) noexcept;

  // Broadcasters holding this listener by plain pointer, in attach order.
  // Guarded by mBroadcastersBusy, which is taken after any core's lock.
  BackLinkList mBroadcasters;
  mutable std::atomic<bool> mBroadcastersBusy{false};
  std::atomic<bool> mListening{true};  // read by the delivering (main) thread
  std::uint32_t mHearsOnly = 0;        // see HearOnly; read by broadcasters when it is attached
};

}  // namespace Tarn
