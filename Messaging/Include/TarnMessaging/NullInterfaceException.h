// Tarn::NullInterfaceException: raised when a null Tarn::InterfaceRef is
// dereferenced. The library never dereferences a null reference itself.
//
// Threading: a value; not synchronised.
#pragma once

#include <TarnMessaging/Export.h>

#include <TarnFoundation/Exception.h>
#include <kivcore/SmallBlockAllocator.h>

#include <string>

namespace Tarn {

class TARN_MESSAGING_API NullInterfaceException : public Exception {
public:
  using Text = std::basic_string<char, std::char_traits<char>, kivcore::utility::SmallBlockAllocator::STLAllocator<char>>;

  // inDetail follows the fixed opening "A NULL interface pointer has been
  // dereferenced: ". Throws std::bad_alloc when storage is out.
  explicit NullInterfaceException(const char* inDetail);
  NullInterfaceException(const NullInterfaceException& inOther);
  ~NullInterfaceException() override;
  const char* what() const noexcept override;

private:
  Text mText;
};

}  // namespace Tarn
