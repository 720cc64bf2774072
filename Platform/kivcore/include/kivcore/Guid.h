// kivcore::utility::Guid: a 128-bit random identifier.
//
//   std::string text = Guid::CreateUnique().AsUTF8String();
//   // "{1b4e28ba-2fa1-11d2-883f-0016d3cca427}"
//
// Threading: CreateUnique may be called from any thread; each call returns a
// new identifier.
#pragma once

#include <kivcore/Export.h>

#include <array>
#include <cstdint>
#include <string>

namespace kivcore::utility {

class KIVCORE_API Guid {
public:
  Guid() noexcept : mBytes{} {}
  static Guid CreateUnique();
  // Lower-case hexadecimal in the usual 8-4-4-4-12 grouping, in braces.
  std::string AsUTF8String() const;
  const std::array<std::uint8_t, 16>& Bytes() const noexcept { return mBytes; }
  friend bool operator==(const Guid& inA, const Guid& inB) noexcept { return inA.mBytes == inB.mBytes; }

private:
  std::array<std::uint8_t, 16> mBytes;
};

}  // namespace kivcore::utility
