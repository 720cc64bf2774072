/// @file
/// Counted safe listeners: host objects that receive messages through the
/// ISafeListener interface and are held by broadcasters only through their
/// weak reference, never kept alive by them.
///
/// The library relies on this contract: the object implements both
/// ISafeListener and IWeakReferenceCapable; its reference count lives in its
/// WeakReference block; when the last reference goes, the count is left
/// negative (so a late resolution sees the object gone) and the object is
/// deleted. SafeListenerBase below does all of that; derive from it:
///
/// @code{.cpp}
///   class Logger : public Tarn::SafeListenerBase {
///     void ListenToMessage(const Tarn::Message& inMessage) override { ... }
///   };
///   Tarn::InterfaceRef<Tarn::ISafeListener> logger(new Logger);  // count 1
///   broadcaster.AddListener(logger);   // holds the weak reference only
///   logger = nullptr;                  // Logger is deleted, entry pruned later
/// @endcode
///
/// Threading: AddRef and Release may be called from any thread; a resolution
/// racing with the last Release either gets a reference that keeps the object
/// alive for the whole delivery or finds the object gone. ListenToMessage is
/// called on the main thread during a broadcast.
#pragma once

#include <TarnMessaging/Export.h>
#include <TarnMessaging/NullInterfaceException.h>

#include <boost/shared_ptr.hpp>

#include <atomic>
#include <climits>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <typeinfo>
#include <utility>

namespace Tarn {

class Message;

/// A 16-byte interface identifier in the usual mixed-endian layout.
struct IID {
  std::uint32_t mData1;    ///< first 4 bytes
  std::uint16_t mData2;    ///< next 2 bytes
  std::uint16_t mData3;    ///< next 2 bytes
  std::uint8_t mData4[8];  ///< last 8 bytes, in order
};
/// Byte-wise comparison of two identifiers.
/// @{
inline bool operator==(const IID& inA, const IID& inB) noexcept { return std::memcmp(&inA, &inB, sizeof(IID)) == 0; }
inline bool operator!=(const IID& inA, const IID& inB) noexcept { return !(inA == inB); }
/// @}

TARN_MESSAGING_API extern const IID IID_ISafeListener;          ///< {C51D0DEC-EFE2-48EE-8514-FAEB6D01C8F8}
TARN_MESSAGING_API extern const IID IID_IWeakReferenceCapable;  ///< {F30494F3-AFD0-4490-94B8-0ED6670526FF}

/// Status codes of QueryInterface: negative is failure.
constexpr std::int32_t kInterfaceOK = 0;
constexpr std::int32_t kNoInterface = -2147467262;  ///< 0x80004002

/// The counted base of ISafeListener and IWeakReferenceCapable.
class IRefCounted {
public:
  /// Adds a reference and returns the new count. Any thread.
  virtual std::int32_t AddRef() = 0;
  /// Drops a reference and returns the new count; the object deletes itself
  /// when the count reaches zero. Any thread.
  virtual std::int32_t Release() = 0;
  /// Reserved; the library never calls it.
  virtual std::int32_t ReservedOperation1() { return 0; }
  /// Stores the object's interface for inIID in *outInterface and returns a
  /// non-negative status, or returns a negative status. Adds no reference:
  /// the caller's reference counts for the interface obtained.
  virtual std::int32_t QueryInterface(const IID& inIID, void** outInterface) = 0;
  /// Reserved; the library never calls it.
  virtual std::int32_t ReservedOperation2() { return 0; }

protected:
  ~IRefCounted() = default;  ///< objects go away through Release
};

/// The interface of a counted safe listener, which broadcasters hold only
/// through its weak reference (IWeakReferenceCapable) and never keep alive.
class ISafeListener : public IRefCounted {
public:
  /// The handler; called on the main thread during a broadcast.
  virtual void ListenToMessage(const Message& inMessage) = 0;

protected:
  ~ISafeListener() = default;
};

/// Shared between an object and every holder of its weak reference.
struct WeakReference {
  IRefCounted* mObject = nullptr;          ///< the object; valid only while mRefCount is positive
  std::atomic<std::int32_t> mRefCount{0};  ///< the object's count; negative once it is gone
};

/// The count a dead object leaves in its block: far enough below zero that
/// increments from failed resolutions never make it positive again.
constexpr std::int32_t kWeakReferenceDead = INT32_MIN / 2;

/// The interface through which an object hands out its weak-reference block.
class IWeakReferenceCapable : public IRefCounted {
public:
  /// The object's weak-reference block; every call returns the same block.
  virtual boost::shared_ptr<WeakReference> GetWeakReference() = 0;

protected:
  ~IWeakReferenceCapable() = default;
};

/// The identifier InterfaceRef asks QueryInterface for, per interface.
template <class U>
struct InterfaceTraits;
/// ISafeListener's identifier.
template <>
struct InterfaceTraits<ISafeListener> {
  /// IID_ISafeListener.
  static const IID& GetIID() noexcept { return IID_ISafeListener; }
};
/// IWeakReferenceCapable's identifier.
template <>
struct InterfaceTraits<IWeakReferenceCapable> {
  /// IID_IWeakReferenceCapable.
  static const IID& GetIID() noexcept { return IID_IWeakReferenceCapable; }
};

/// Throws NullInterfaceException naming inInterfaceName; what
/// InterfaceRef's dereference calls on a null reference.
[[noreturn]] TARN_MESSAGING_API void ThrowNullInterfaceException(const char* inInterfaceName);

/// A counted reference to an interface T (asked for by U's identifier).
/// Default-constructed it is null; made from a T* it adds a reference; copies
/// add one; destruction releases one. Converting from a reference to another
/// interface asks the object with QueryInterface and holds null when the
/// object does not offer the interface. Dereferencing a null reference throws
/// NullInterfaceException.
///
/// Threading: one InterfaceRef is a value; distinct references to one object
/// may be used on different threads (the object's count is atomic).
template <class T, class U = T>
class InterfaceRef {
public:
  /// A null reference.
  /// @{
  InterfaceRef() noexcept = default;
  InterfaceRef(std::nullptr_t) noexcept {}
  /// @}
  /// A reference to inInterface, adding one to its count; null when it is null.
  InterfaceRef(T* inInterface) noexcept : mInterface(inInterface) {
    if (mInterface != nullptr) mInterface->AddRef();
  }
  /// Another reference to the same object, adding one to its count.
  InterfaceRef(const InterfaceRef& inOther) noexcept : InterfaceRef(inOther.mInterface) {}
  /// Takes inOther's reference; inOther becomes null.
  InterfaceRef(InterfaceRef&& inOther) noexcept : mInterface(std::exchange(inOther.mInterface, nullptr)) {}
  /// A reference to the object behind inOther as interface T, obtained with
  /// QueryInterface; null when inOther is null or the object does not offer it.
  template <class T2, class U2>
  explicit InterfaceRef(const InterfaceRef<T2, U2>& inOther) noexcept {
    T2* source = inOther.get();
    if (source == nullptr) return;
    source->AddRef();
    void* result = nullptr;
    if (source->QueryInterface(InterfaceTraits<U>::GetIID(), &result) >= 0 && result != nullptr) {
      mInterface = static_cast<T*>(result);  // owns the reference just added
    } else {
      source->Release();
    }
  }
  ~InterfaceRef() {
    if (mInterface != nullptr) mInterface->Release();
  }
  /// Refers to inOther's object instead, releasing the one held before.
  InterfaceRef& operator=(InterfaceRef inOther) noexcept {
    std::swap(mInterface, inOther.mInterface);
    return *this;
  }

  /// Takes over a reference the caller already owns (no AddRef).
  static InterfaceRef Adopt(T* inInterface) noexcept {
    InterfaceRef result;
    result.mInterface = inInterface;
    return result;
  }

  /// The interface, or null; no reference is added.
  T* get() const noexcept { return mInterface; }
  /// The interface. Throws NullInterfaceException when null.
  /// @{
  T* operator->() const {
    if (mInterface == nullptr) ThrowNullInterfaceException(typeid(T).name());
    return mInterface;
  }
  T& operator*() const { return *operator->(); }
  /// @}
  /// Whether the reference is not null.
  explicit operator bool() const noexcept { return mInterface != nullptr; }
  /// Comparisons by interface pointer, and with null.
  /// @{

  friend bool operator==(const InterfaceRef& inRef, std::nullptr_t) noexcept { return inRef.mInterface == nullptr; }
  friend bool operator!=(const InterfaceRef& inRef, std::nullptr_t) noexcept { return inRef.mInterface != nullptr; }
  friend bool operator==(const InterfaceRef& inA, const InterfaceRef& inB) noexcept { return inA.mInterface == inB.mInterface; }
  friend bool operator!=(const InterfaceRef& inA, const InterfaceRef& inB) noexcept { return inA.mInterface != inB.mInterface; }
  /// @}

private:
  T* mInterface = nullptr;
};

/// A counted reference to a safe listener.
using ISafeListenerRef = InterfaceRef<ISafeListener, ISafeListener>;
/// A counted reference to an object's IWeakReferenceCapable interface.
using IWeakReferenceCapableRef = InterfaceRef<IWeakReferenceCapable, IWeakReferenceCapable>;

/// The broadcaster's handle for a safe listener: its weak-reference block, or
/// empty when inListener is null or offers no IWeakReferenceCapable.
TARN_MESSAGING_API boost::shared_ptr<WeakReference> GetSafeListenerHandle(const ISafeListenerRef& inListener);

/// Resolves a handle to a counted reference, or null when the handle is
/// empty, the object is gone, or it does not offer ISafeListener.
TARN_MESSAGING_API ISafeListenerRef ResolveSafeListener(const boost::shared_ptr<WeakReference>& inHandle);

/// A new weak-reference block naming inObject, with a count of 0. Out of
/// line so that this header need not pull in the allocation templates.
TARN_MESSAGING_API boost::shared_ptr<WeakReference> MakeWeakReference(ISafeListener* inObject);

/// A correct counted safe listener for hosts, tests and examples: both
/// interfaces, the count in the weak-reference block, the negative count and
/// the delete at the last Release. Create with new and hold in an
/// InterfaceRef at once; the count starts at 0.
class SafeListenerBase : public ISafeListener, public IWeakReferenceCapable {
public:
  SafeListenerBase() : mWeakReference(MakeWeakReference(static_cast<ISafeListener*>(this))) {}
  SafeListenerBase(const SafeListenerBase&) = delete;
  SafeListenerBase& operator=(const SafeListenerBase&) = delete;

  /// Adds a reference in the weak-reference block's count.
  std::int32_t AddRef() override { return mWeakReference->mRefCount.fetch_add(1, std::memory_order_relaxed) + 1; }

  /// Drops a reference; the last one leaves the count at kWeakReferenceDead
  /// and deletes the object, unless a resolver revived it meanwhile.
  std::int32_t Release() override {
    std::atomic<std::int32_t>& count = mWeakReference->mRefCount;
    std::int32_t current = count.load(std::memory_order_relaxed);
    while (current > 1) {
      if (count.compare_exchange_weak(current, current - 1, std::memory_order_acq_rel, std::memory_order_relaxed)) {
        return current - 1;
      }
    }
    // Possibly the last reference. Once the count reaches 0 a resolver on
    // another thread may revive the object, release it and delete it, so from
    // here on only a block of our own is touched, never a member.
    const boost::shared_ptr<WeakReference> block = mWeakReference;
    const std::int32_t remaining = block->mRefCount.fetch_sub(1, std::memory_order_acq_rel) - 1;
    if (remaining != 0) return remaining;
    // Only the thread that turns 0 into the dead mark deletes the object.
    std::int32_t expected = 0;
    if (block->mRefCount.compare_exchange_strong(expected, kWeakReferenceDead, std::memory_order_acq_rel)) {
      delete this;
    }
    return 0;
  }

  std::int32_t QueryInterface(const IID& inIID, void** outInterface) override {
    if (outInterface == nullptr) return kNoInterface;
    if (inIID == IID_ISafeListener) {
      *outInterface = static_cast<ISafeListener*>(this);
      return kInterfaceOK;
    }
    if (inIID == IID_IWeakReferenceCapable) {
      *outInterface = static_cast<IWeakReferenceCapable*>(this);
      return kInterfaceOK;
    }
    *outInterface = nullptr;
    return kNoInterface;
  }

  boost::shared_ptr<WeakReference> GetWeakReference() override { return mWeakReference; }

protected:
  virtual ~SafeListenerBase() = default;

private:
  boost::shared_ptr<WeakReference> mWeakReference;
};

}  // namespace Tarn
