/// @file
/// Tarn::NullInterfaceException: raised when a null Tarn::InterfaceRef is
/// dereferenced. The library never dereferences a null reference itself.
///
/// Threading: a value; not synchronised.
#pragma once

#include <TarnMessaging/Export.h>

#include <TarnFoundation/Exception.h>
#include <kivcore/SmallBlockAllocator.h>

#include <string>

namespace Tarn {

/// Raised when a null InterfaceRef is dereferenced; what() names the
/// interface. A value; not synchronised.
class TARN_MESSAGING_API NullInterfaceException : public Exception {
public:
  /// The text's string type, in small-block storage.
  using Text = std::basic_string<char, std::char_traits<char>, kivcore::utility::SmallBlockAllocator::STLAllocator<char>>;

  /// inDetail follows the fixed opening "A NULL interface pointer has been
  /// dereferenced: ". Throws std::bad_alloc when storage is out.
  explicit NullInterfaceException(const char* inDetail);
  /// A copy of the text. Throws std::bad_alloc when storage is out.
  NullInterfaceException(const NullInterfaceException& inOther);
  ~NullInterfaceException() override;
  /// The fixed opening followed by the detail.
  const char* what() const noexcept override;

private:
  Text mText;
};

}  // namespace Tarn
