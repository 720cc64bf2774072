// Tarn::Exception: the base class of Tarn exceptions.
//
// Threading: a value; not synchronised.
#pragma once

#include <TarnFoundation/Export.h>

#include <exception>

namespace Tarn {

class TARNFOUNDATION_API Exception : public std::exception {
public:
  Exception() noexcept;
  Exception(const Exception&) noexcept = default;
  Exception& operator=(const Exception&) noexcept = default;
  ~Exception() override;
  const char* what() const noexcept override;
};

}  // namespace Tarn
