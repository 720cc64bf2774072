// The process's wire registry: wire-enabled message types by wire name and
// by in-process message ID.
#include <TarnMessaging/Remote/WireMessage.h>

#include "RemoteContract.h"

#include <kivcore/Error.h>

#include <mutex>
#include <string>
#include <unordered_map>

namespace Tarn::Remote {
namespace {

struct Registry {
  std::mutex mMutex;
  std::unordered_map<std::string, const WireType*> mByName;  // guarded by mMutex
  std::unordered_map<MessageID, const WireType*> mByID;      // guarded by mMutex
};

// Made on first use: registrations run during the static initialisation of
// whichever module declares a wire type first, which may precede ours.
Registry& TheRegistry() {
  static Registry* sRegistry = new Registry;  // never destroyed: modules may register until the very end
  return *sRegistry;
}

int ReportNameTaken() {
  Detail::ReportContractViolation("FindWireType(inType.mWireName) == NULL", __FILE__, "Tarn::Remote::RegisterWireType",
                                  __LINE__);
  return 0;
}

}  // namespace

bool RegisterWireType(const WireType& inType) noexcept {
  const MessageID id = inType.mMessageID();
  Registry& registry = TheRegistry();
  bool taken = false;
  {
    std::lock_guard<std::mutex> lock(registry.mMutex);
    auto [named, added] = registry.mByName.emplace(inType.mWireName, &inType);
    if (!added && named->second->mMessageID() != id) {
      taken = true;
    } else {
      registry.mByID.emplace(id, named->second);
    }
  }
  // Reported outside the lock: the host's dialog and error handler may
  // call back into the registry.
  if (taken) kivcore::config::ErrorManager::Get(true)->GuardedCall(&ReportNameTaken);
  return true;
}

const WireType* FindWireType(const char* inWireName, std::size_t inLength) noexcept {
  Registry& registry = TheRegistry();
  try {
    const std::string name(inWireName, inLength);
    std::lock_guard<std::mutex> lock(registry.mMutex);
    const auto found = registry.mByName.find(name);
    return found == registry.mByName.end() ? nullptr : found->second;
  } catch (...) {  // bad_alloc for the key: no type can be found then
    return nullptr;
  }
}

const WireType* FindWireType(MessageID inMessageID) noexcept {
  Registry& registry = TheRegistry();
  std::lock_guard<std::mutex> lock(registry.mMutex);
  const auto found = registry.mByID.find(inMessageID);
  return found == registry.mByID.end() ? nullptr : found->second;
}

}  // namespace Tarn::Remote
