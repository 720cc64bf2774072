// Number formatting shared by the live status line and the summary table.
#pragma once

#include <cstdint>
#include <string>

namespace tarn_demo {

// 1234567 -> "1,234,567".
inline std::string WithSeparators(std::uint64_t inValue) {
  std::string digits = std::to_string(inValue);
  for (std::size_t at = digits.size(); at > 3; at -= 3) digits.insert(at - 3, ",");
  return digits;
}

}  // namespace tarn_demo
