#include <TarnMessaging/MessageImpl.h>
#include <TarnMessaging/NullInterfaceException.h>
#include <TarnMessaging/Tracing.h>

#include "DiagnosticReports.h"

#include <kivcore/MainThread.h>
#include <kivcore/SmallBlockAllocator.h>

#include <boost/function.hpp>

#include <cxxabi.h>

#include <algorithm>
#include <atomic>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <exception>
#include <map>
#include <new>
#include <string>
#include <thread>
#include <typeindex>
#include <typeinfo>
#include <utility>
#include <vector>

namespace Tarn {

using kivcore::utility::ImmutableString;
using kivcore::utility::SmallBlockAllocator;

unsigned int HashMessageTypeNameToMessageID(const char* inTypeName) noexcept {
  std::uint32_t hash = 0;
  for (const char* p = inTypeName; *p != '\0'; ++p) {
    // Bytes count as signed: a high byte lowers the running value.
    hash = hash * 5u + static_cast<std::uint32_t>(static_cast<std::int32_t>(static_cast<signed char>(*p)));
  }
  return hash;
}

// Out of line so that the vtable and type information live in this library.
Message::~Message() = default;

// ---------------------------------------------------------------------------
// IDs of types with internal linkage

namespace Detail {

namespace {
// The live records of types with internal linkage, across all modules. A
// spin lock and a plain pointer, both trivially destructible: a module's exit
// may unlink its records after this library's own statics are gone.
std::atomic_flag sLocalTypesBusy = ATOMIC_FLAG_INIT;
LocalMessageType* sLocalTypes = nullptr;  // guarded by sLocalTypesBusy

class LocalTypesLock {
public:
  LocalTypesLock() noexcept {
    while (sLocalTypesBusy.test_and_set(std::memory_order_acquire)) std::this_thread::yield();
  }
  ~LocalTypesLock() { sLocalTypesBusy.clear(std::memory_order_release); }
  LocalTypesLock(const LocalTypesLock&) = delete;
  LocalTypesLock& operator=(const LocalTypesLock&) = delete;
};
}  // namespace

bool HasInternalLinkage(const char* inTypeName) noexcept {
  // GCC and Clang decorate every anonymous namespace as _GLOBAL__N_1, in
  // every source, so the name alone cannot tell two such types apart; a
  // template argument of such a type gives the instance internal linkage too.
  return std::strstr(inTypeName, "_GLOBAL__N_") != nullptr;
}

LocalMessageType::LocalMessageType(const char* inTypeName) noexcept : mNext(nullptr), mPrevious(nullptr) {
  MessageID id = HashMessageTypeNameToMessageID(inTypeName);
  const LocalTypesLock lock;
  // The first type of a name keeps the name's hash. Every further one steps
  // with a multiplier, not by one: names differing in their last byte hash
  // to neighbouring values.
  for (bool taken = true; taken;) {
    taken = false;
    for (const LocalMessageType* type = sLocalTypes; type != nullptr; type = type->mNext) {
      if (type->mMessageID == id) {
        taken = true;
        id = id * 2654435761u + 1u;
        break;
      }
    }
  }
  mMessageID = id;
  mNext = sLocalTypes;
  if (mNext != nullptr) mNext->mPrevious = this;
  sLocalTypes = this;
}

LocalMessageType::~LocalMessageType() {
  const LocalTypesLock lock;
  if (mPrevious != nullptr) mPrevious->mNext = mNext;
  else sLocalTypes = mNext;
  if (mNext != nullptr) mNext->mPrevious = mPrevious;
}

// ---------------------------------------------------------------------------
// IDs of types with external linkage

namespace {

// Every type name with external linkage whose ID a module has computed, by
// ID, and the few names that had to leave their hash to an earlier one.
// Guarded by the spin lock of the local types. Never destroyed, and its
// storage is the standard allocator's: it lives as long as the process, and a
// module may compute an ID during static destruction.
struct MessageTypeTable {
  std::map<MessageID, std::string> mNames;
  std::map<std::string, MessageID> mMoved;
};

MessageTypeTable& Types() {
  static MessageTypeTable* const sTypes = new MessageTypeTable;
  return *sTypes;
}

// "Demangled (decorated)", or the decorated name alone.
std::string Readable(const std::string& inTypeName) {
  int status = -1;
  char* const demangled = abi::__cxa_demangle(inTypeName.c_str(), nullptr, nullptr, &status);
  std::string text = status == 0 && demangled != nullptr ? std::string(demangled) + " (" + inTypeName + ")" : inTypeName;
  std::free(demangled);
  return text;
}

}  // namespace

MessageID GlobalMessageID(const char* inTypeName) noexcept {
  const MessageID hash = HashMessageTypeNameToMessageID(inTypeName);
  MessageID id = hash;
  std::string earlier;
  try {
    const std::string name = inTypeName;
    {
      const LocalTypesLock lock;
      MessageTypeTable& types = Types();
      const auto moved = types.mMoved.find(name);
      if (moved != types.mMoved.end()) return moved->second;
      const auto holder = types.mNames.try_emplace(hash, name).first;
      if (holder->second == name) return hash;
      // Two types with one ID would make a listener cast a message to the
      // wrong type. The later name steps off the hash as a second local type
      // does, and every module finds it here under its name.
      earlier = holder->second;
      while (id == 0 || types.mNames.count(id) != 0) id = id * 2654435761u + 1u;
      types.mNames.emplace(id, name);
      types.mMoved.emplace(name, id);
    }
    char hashText[16];
    std::snprintf(hashText, sizeof hashText, "0x%08X", static_cast<unsigned>(hash));
    Diagnostics::Detail::ReportContractViolation(
        "message types " + Readable(earlier) + " and " + Readable(name) + " have one message ID " + hashText +
            ", so one was given another ID: rename one of them",
        __FILE__, "Tarn::MessageImpl::StaticMessageID", __LINE__);
  } catch (const std::exception& inError) {
    // Called from a noexcept function: a throwing error handler (the
    // default one) cannot take the report up the stack, so it goes here.
    std::fprintf(stderr, "TarnMessaging: %s\n", inError.what());
  } catch (...) {
    // Out of storage: the type keeps its hash, unrecorded, as before.
  }
  return id;
}

// ---------------------------------------------------------------------------
// Posted copies

namespace {

// One small block: this header, then the copy of the message at
// kMessageOffset. Shared by the copies of one function object.
struct PostedCopy {
  std::atomic<long> mOwners{1};
  ImmutableString mStationID;
  Message* mMessage = nullptr;
  std::size_t mBlockSize = 0;
};
constexpr std::size_t kMessageOffset =
    (sizeof(PostedCopy) + alignof(std::max_align_t) - 1) / alignof(std::max_align_t) * alignof(std::max_align_t);

void ReleasePostedCopy(PostedCopy* inCopy) noexcept {
  // A queued post has one owner when it is released: nobody else can then
  // take a new one, so the read-modify-write (a locked bus cycle per post)
  // is needed only while a copy of the function object is alive. The
  // acquire pairs with the release of the owners that went before.
  if (inCopy->mOwners.load(std::memory_order_acquire) != 1 &&
      inCopy->mOwners.fetch_sub(1, std::memory_order_acq_rel) != 1)
    return;
  const std::size_t size = inCopy->mBlockSize;
  inCopy->mMessage->~Message();
  inCopy->~PostedCopy();
  SmallBlockAllocator::Dispose(inCopy, size);
}

// The function object CreateCallback returns: one pointer, so that it lies
// inside the boost::function and costs no allocation of its own. Made empty
// and given its copy once inside the function object: boost::function copies
// the object it is built from several times on the way in, and each copy of
// a full one would cost two atomic updates of the owner count.
class PostedCall {
public:
  PostedCall() noexcept : mCopy(nullptr) {}
  PostedCall(const PostedCall& inOther) noexcept : mCopy(inOther.mCopy) {
    if (mCopy != nullptr) mCopy->mOwners.fetch_add(1, std::memory_order_relaxed);
  }
  PostedCall& operator=(const PostedCall&) = delete;
  ~PostedCall() {
    if (mCopy != nullptr) ReleasePostedCopy(mCopy);
  }

  // Takes over the one owner that CreateCallback made.
  void Adopt(PostedCopy* inCopy) noexcept { mCopy = inCopy; }

  void operator()() const { StationUtils::BroadcastPostedCopy(mCopy->mStationID, *mCopy->mMessage); }

  const PostedCopy& Copy() const noexcept { return *mCopy; }

private:
  PostedCopy* mCopy;  // one of its owners; null only before Adopt
};
static_assert(boost::detail::function::function_allows_small_object_optimization<PostedCall>::value,
              "a posted call must fit inside boost::function");

// The census of the main thread's queue for its high-water report: plain
// posts by station and message type, the largest groups first. Runs under
// the queue's lock, so it reads only what the posts hold.
std::string DescribePostedCalls(const boost::function<void()>* inCalls, std::size_t inCount) {
  struct Group {
    ImmutableString mStationID;
    std::type_index mType;
    std::size_t mCount;
  };
  // Station IDs are interned: equal IDs share their text.
  std::map<std::pair<const char*, std::type_index>, Group> groups;
  std::size_t others = 0;
  for (std::size_t i = 0; i < inCount; ++i) {
    const PostedCall* const call = inCalls[i].target<PostedCall>();
    if (call == nullptr) {
      ++others;
      continue;
    }
    const PostedCopy& copy = call->Copy();
    const std::type_index type(typeid(*copy.mMessage));
    const std::pair<const char*, std::type_index> key(copy.mStationID.c_str(), type);
    auto entry = groups.find(key);
    if (entry == groups.end()) entry = groups.emplace(key, Group{copy.mStationID, type, 0}).first;
    ++entry->second.mCount;
  }
  std::vector<const Group*> largest;
  for (const auto& entry : groups) largest.push_back(&entry.second);
  std::sort(largest.begin(), largest.end(), [](const Group* inA, const Group* inB) { return inA->mCount > inB->mCount; });
  constexpr std::size_t kNamed = 10;
  std::string text = "Queued:";
  for (std::size_t i = 0; i < largest.size() && i < kNamed; ++i) {
    text += " " + std::to_string(largest[i]->mCount) + " posts of " + Tracing::ReadableTypeName(largest[i]->mType.name()) +
            " to station \"" + largest[i]->mStationID.c_str() + "\";";
  }
  std::size_t rest = 0;
  for (std::size_t i = kNamed; i < largest.size(); ++i) rest += largest[i]->mCount;
  if (rest != 0) text += " " + std::to_string(rest) + " posts to " + std::to_string(largest.size() - kNamed) + " more groups;";
  text += " " + std::to_string(others) + " other calls (cancellable, coalesced and the host's own).";
  return text;
}

// The census is this library's for as long as it is loaded.
struct CensusInstaller {
  CensusInstaller() noexcept { kivcore::threads::SetPendingCallCensus(&DescribePostedCalls); }
  ~CensusInstaller() { kivcore::threads::SetPendingCallCensus(nullptr); }
} sCensusInstaller;

}  // namespace

MessageImplBase::~MessageImplBase() = default;

boost::function<void()> MessageImplBase::CreateCallback(const ImmutableString& inStationID) const {
  const std::size_t size = kMessageOffset + CopySize();
  void* const block = SmallBlockAllocator::Allocate(size);
  if (block == nullptr) throw std::bad_alloc();
  PostedCopy* const copy = new (block) PostedCopy;
  copy->mBlockSize = size;
  try {
    copy->mStationID = inStationID;
    copy->mMessage = CopyInto(static_cast<char*>(block) + kMessageOffset);
  } catch (...) {
    copy->~PostedCopy();
    SmallBlockAllocator::Dispose(block, size);
    throw;
  }
  boost::function<void()> call{PostedCall()};
  call.target<PostedCall>()->Adopt(copy);
  return call;
}

}  // namespace Detail

// ---------------------------------------------------------------------------
// NullInterfaceException

namespace {
constexpr char kNullInterfacePrefix[] = "A NULL interface pointer has been dereferenced: ";
}

NullInterfaceException::NullInterfaceException(const char* inDetail) : mText(kNullInterfacePrefix) {
  if (inDetail != nullptr) mText.append(inDetail);
}

NullInterfaceException::NullInterfaceException(const NullInterfaceException& inOther)
    : Exception(inOther), mText(inOther.mText) {}

NullInterfaceException::~NullInterfaceException() = default;

const char* NullInterfaceException::what() const noexcept { return mText.c_str(); }

}  // namespace Tarn
