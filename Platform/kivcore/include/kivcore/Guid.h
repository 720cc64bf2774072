/// @file
/// kivcore::utility::Guid: a 128-bit random identifier.
///
/// @code{.cpp}
///   std::string text = Guid::CreateUnique().AsUTF8String();
///   // "{1b4e28ba-2fa1-11d2-883f-0016d3cca427}"
/// @endcode
///
/// Threading: CreateUnique may be called from any thread; each call returns a
/// new identifier.
#pragma once

#include <kivcore/Export.h>

#include <array>
#include <cstdint>
#include <string>

namespace kivcore::utility {

/// A 128-bit random identifier; a value type. CreateUnique may be called
/// from any thread.
class KIVCORE_API Guid {
public:
  /// The all-zero identifier.
  Guid() noexcept : mBytes{} {}
  /// A new random identifier, different on every call.
  static Guid CreateUnique();
  /// Lower-case hexadecimal in the usual 8-4-4-4-12 grouping, in braces.
  std::string AsUTF8String() const;
  /// The 16 bytes of the identifier.
  const std::array<std::uint8_t, 16>& Bytes() const noexcept { return mBytes; }
  /// Byte-wise equality.
  friend bool operator==(const Guid& inA, const Guid& inB) noexcept { return inA.mBytes == inB.mBytes; }

private:
  std::array<std::uint8_t, 16> mBytes;
};

}  // namespace kivcore::utility
