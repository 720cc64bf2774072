#include <TarnMessaging/SafeListener.h>

#include <boost/make_shared.hpp>

namespace Tarn {

boost::shared_ptr<WeakReference> MakeWeakReference(ISafeListener* inObject) {
  const boost::shared_ptr<WeakReference> block = boost::make_shared<WeakReference>();
  block->mObject = inObject;
  return block;
}

const IID IID_ISafeListener = {0xC51D0DEC, 0xEFE2, 0x48EE, {0x85, 0x14, 0xFA, 0xEB, 0x6D, 0x01, 0xC8, 0xF8}};
const IID IID_IWeakReferenceCapable = {0xF30494F3, 0xAFD0, 0x4490, {0x94, 0xB8, 0x0E, 0xD6, 0x67, 0x05, 0x26, 0xFF}};

void ThrowNullInterfaceException(const char* inInterfaceName) { throw NullInterfaceException(inInterfaceName); }

boost::shared_ptr<WeakReference> GetSafeListenerHandle(const ISafeListenerRef& inListener) {
  if (inListener == nullptr) return {};
  IWeakReferenceCapableRef capable(inListener);
  if (capable == nullptr) return {};
  return capable->GetWeakReference();
}

ISafeListenerRef ResolveSafeListener(const boost::shared_ptr<WeakReference>& inHandle) {
  if (!inHandle) return {};
  // The increment decides a race with the object's last Release: a positive
  // result is a reference of ours; otherwise the object is gone, and the
  // increment is not taken back (the dead mark leaves room for it).
  if (inHandle->mRefCount.fetch_add(1, std::memory_order_acq_rel) + 1 <= 0) return {};
  IRefCounted* object = inHandle->mObject;
  if (object == nullptr) return {};  // a block whose owner never filled it in
  void* result = nullptr;
  if (object->QueryInterface(IID_ISafeListener, &result) >= 0 && result != nullptr) {
    return ISafeListenerRef::Adopt(static_cast<ISafeListener*>(result));
  }
  object->Release();
  return {};
}

}  // namespace Tarn
