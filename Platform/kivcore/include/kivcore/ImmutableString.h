/// @file
/// kivcore::utility::ImmutableString: an interned, immutable UTF-8 string.
///
/// Two strings made from the same text, statically or dynamically, share one
/// interned representation, so equality and ordering compare that
/// representation's address and never the text. Copies are one atomic
/// increment; an interned text is freed when its last string goes away.
///
/// @code{.cpp}
///   auto a = ImmutableString::CreateStatic("tarn.idle");
///   auto b = ImmutableString::CreateDynamic(std::string("tarn.") + "idle");
///   assert(a == b);                  // same identity
///   std::puts(a.c_str());            // "tarn.idle"
/// @endcode
///
/// Threading: every operation may be called from any thread. One string object
/// is a value like an int: do not assign to it on one thread while another
/// reads it. The intern table lives once per process, inside kivcore, so all
/// modules agree on identities.
#pragma once

#include <kivcore/Export.h>

#include <cstddef>
#include <string_view>

namespace kivcore::utility {

/// An interned, immutable UTF-8 string, compared by identity: equal texts
/// are the same string. A value type; copies may be made, compared and
/// destroyed on any thread.
class KIVCORE_API ImmutableString {
public:
  struct Rep;  ///< opaque interned text, owned by the intern table

  /// The empty string; names nothing.
  ImmutableString() noexcept = default;
  /// The same string; counts one more holder of the text.
  ImmutableString(const ImmutableString& inOther) noexcept;
  /// Takes inOther's text; inOther becomes the empty string.
  ImmutableString(ImmutableString&& inOther) noexcept : mRep(inOther.mRep) { inOther.mRep = nullptr; }
  /// Refers to inOther's text instead.
  ImmutableString& operator=(const ImmutableString& inOther) noexcept;
  /// Takes inOther's text; inOther becomes the empty string.
  ImmutableString& operator=(ImmutableString&& inOther) noexcept;
  ~ImmutableString();

  /// The string for a literal's text. inText must not be null.
  static ImmutableString CreateStatic(const char* inText);
  /// A string owning (through the intern table) a copy of inText.
  /// Throws std::bad_alloc when no memory is left.
  static ImmutableString CreateDynamic(std::string_view inText);

  /// Whether this is the empty string.
  bool empty() const noexcept { return mRep == nullptr; }
  /// The NUL-terminated UTF-8 text; "" for the empty string.
  const char* c_str() const noexcept;
  /// Length of the text in bytes.
  std::size_t size() const noexcept;

  /// Identity comparisons: equal texts are equal strings because they are
  /// interned; the order is by address, not alphabetical.
  /// @{
  friend bool operator==(const ImmutableString& inA, const ImmutableString& inB) noexcept { return inA.mRep == inB.mRep; }
  friend bool operator!=(const ImmutableString& inA, const ImmutableString& inB) noexcept { return inA.mRep != inB.mRep; }
  friend bool operator<(const ImmutableString& inA, const ImmutableString& inB) noexcept;
  /// @}

  /// Number of distinct texts interned in the process right now (for tests).
  static std::size_t InternedCount();

private:
  explicit ImmutableString(Rep* inRep) noexcept : mRep(inRep) {}
  static ImmutableString Intern(std::string_view inText);

  Rep* mRep = nullptr;
};

/// The strict order of strings by identity (address of the interned text).
inline bool operator<(const ImmutableString& inA, const ImmutableString& inB) noexcept {
  return reinterpret_cast<std::size_t>(inA.mRep) < reinterpret_cast<std::size_t>(inB.mRep);
}

}  // namespace kivcore::utility
