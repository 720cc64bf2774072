#include <TarnMessaging/Message.h>
#include <TarnMessaging/NullInterfaceException.h>

#include <cstdint>
#include <cstring>

namespace Tarn {

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
