#include <TarnFoundation/Exception.h>

namespace Tarn {

Exception::Exception() noexcept = default;

Exception::~Exception() = default;

const char* Exception::what() const noexcept { return "Tarn::Exception"; }

}  // namespace Tarn
