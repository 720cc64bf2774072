// Guid: random (version 4) identifiers from a per-thread generator, so that
// threads making identifiers never contend.
#include <kivcore/Guid.h>

#include <boost/uuid/random_generator.hpp>
#include <boost/uuid/uuid.hpp>

#include <algorithm>

namespace kivcore::utility {

Guid Guid::CreateUnique() {
  static thread_local boost::uuids::random_generator generator;
  const boost::uuids::uuid id = generator();
  Guid guid;
  std::copy(id.begin(), id.end(), guid.mBytes.begin());
  return guid;
}

std::string Guid::AsUTF8String() const {
  static constexpr char kDigits[] = "0123456789abcdef";
  std::string text;
  text.reserve(38);
  text.push_back('{');
  for (std::size_t i = 0; i < mBytes.size(); ++i) {
    if (i == 4 || i == 6 || i == 8 || i == 10) text.push_back('-');
    text.push_back(kDigits[mBytes[i] >> 4]);
    text.push_back(kDigits[mBytes[i] & 0x0F]);
  }
  text.push_back('}');
  return text;
}

}  // namespace kivcore::utility
