// Guid: random (version 4) identifiers from a per-thread generator, so that
// threads making identifiers never contend.
#include <kivcore/Guid.h>

#include <boost/uuid/random_generator.hpp>
#include <boost/uuid/uuid.hpp>

#include <algorithm>
#include <type_traits>

namespace kivcore::utility {

Guid Guid::CreateUnique() {
  using Generator = boost::uuids::random_generator;
  boost::uuids::uuid id;
  // Kept per thread only while it has no destructor (the operating system's
  // generator): a later thread_local or thread-specific-data destructor may
  // still make identifiers, after a destructor would have run.
  if constexpr (std::is_trivially_destructible<Generator>::value) {
    static thread_local Generator generator;
    id = generator();
  } else {
    id = Generator()();
  }
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
