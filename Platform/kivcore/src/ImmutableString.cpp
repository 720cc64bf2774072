// The process-wide intern table behind ImmutableString.
//
// Every non-empty text lives once, in a Rep owned by the table: a reference
// count, the length, and the NUL-terminated bytes right after the header.
// Strings hold a counted pointer to their Rep; the table maps the text to
// the Rep without holding a count of its own.
//
// The one delicate step is the last release racing a new intern of the same
// text. A count above 1 is lowered without the lock: other holders remain,
// so nobody can be waiting to free the Rep. The step from 1 to 0 is only
// ever taken under the table lock, and interning raises the count under the
// same lock, so a Rep reached through the table is never one being freed.
#include <kivcore/ImmutableString.h>

#include <atomic>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <new>
#include <string_view>
#include <unordered_map>

namespace kivcore::utility {

struct ImmutableString::Rep {
  std::atomic<int> refs;
  std::size_t length;

  char* Text() noexcept { return reinterpret_cast<char*>(this + 1); }
  std::string_view View() noexcept { return std::string_view(Text(), length); }
};

namespace {

using Rep = ImmutableString::Rep;

struct InternTable {
  std::mutex mutex;
  std::unordered_map<std::string_view, Rep*> reps;  // keys view each Rep's own text; guarded by mutex
};

// Never destroyed: strings held by static objects of other modules may be
// released during static destruction, in any order relative to this one.
InternTable& Table() {
  static InternTable* table = new InternTable;
  return *table;
}

void AddRef(Rep* inRep) noexcept {
  if (inRep != nullptr) inRep->refs.fetch_add(1, std::memory_order_relaxed);
}

void Release(Rep* inRep) noexcept {
  if (inRep == nullptr) return;
  int count = inRep->refs.load(std::memory_order_relaxed);
  while (count > 1) {
    if (inRep->refs.compare_exchange_weak(count, count - 1, std::memory_order_acq_rel, std::memory_order_relaxed))
      return;
  }
  // Possibly the last reference: settle it where interning cannot revive it
  // behind our back.
  InternTable& table = Table();
  std::lock_guard<std::mutex> lock(table.mutex);
  if (inRep->refs.fetch_sub(1, std::memory_order_acq_rel) != 1) return;
  table.reps.erase(inRep->View());
  std::free(inRep);
}

}  // namespace

ImmutableString::ImmutableString(const ImmutableString& inOther) noexcept : mRep(inOther.mRep) { AddRef(mRep); }

// NOLINTNEXTLINE(bugprone-unhandled-self-assignment): the reference is raised before the old one drops.
ImmutableString& ImmutableString::operator=(const ImmutableString& inOther) noexcept {
  // Raise first: inOther may be this string, or hold the last reference to
  // the same Rep through another object.
  AddRef(inOther.mRep);
  Rep* old = mRep;
  mRep = inOther.mRep;
  Release(old);
  return *this;
}

ImmutableString& ImmutableString::operator=(ImmutableString&& inOther) noexcept {
  if (this != &inOther) {
    Rep* old = mRep;
    mRep = inOther.mRep;
    inOther.mRep = nullptr;
    Release(old);
  }
  return *this;
}

ImmutableString::~ImmutableString() { Release(mRep); }

ImmutableString ImmutableString::CreateStatic(const char* inText) { return Intern(std::string_view(inText)); }

ImmutableString ImmutableString::CreateDynamic(std::string_view inText) { return Intern(inText); }

ImmutableString ImmutableString::Intern(std::string_view inText) {
  if (inText.empty()) return ImmutableString();

  InternTable& table = Table();
  std::lock_guard<std::mutex> lock(table.mutex);
  auto found = table.reps.find(inText);
  if (found != table.reps.end()) {
    AddRef(found->second);
    return ImmutableString(found->second);
  }

  void* storage = std::malloc(sizeof(Rep) + inText.size() + 1);
  if (storage == nullptr) throw std::bad_alloc();
  Rep* rep = new (storage) Rep;
  rep->refs.store(1, std::memory_order_relaxed);
  rep->length = inText.size();
  std::memcpy(rep->Text(), inText.data(), inText.size());
  rep->Text()[inText.size()] = '\0';
  try {
    table.reps.emplace(rep->View(), rep);
  } catch (...) {
    std::free(rep);
    throw;
  }
  return ImmutableString(rep);
}

const char* ImmutableString::c_str() const noexcept { return mRep != nullptr ? mRep->Text() : ""; }

std::size_t ImmutableString::size() const noexcept { return mRep != nullptr ? mRep->length : 0; }

std::size_t ImmutableString::InternedCount() {
  InternTable& table = Table();
  std::lock_guard<std::mutex> lock(table.mutex);
  return table.reps.size();
}

}  // namespace kivcore::utility
