/// @file
/// Tarn::Exception: the base class of Tarn exceptions.
///
/// Threading: a value; not synchronised.
#pragma once

#include <TarnFoundation/Export.h>

#include <exception>

namespace Tarn {

/// The base class of the exceptions of Tarn libraries, itself a
/// std::exception. A value; not synchronised.
class TARNFOUNDATION_API Exception : public std::exception {
public:
  /// An exception with the generic text.
  Exception() noexcept;
  /// Copies are cheap and cannot throw.
  /// @{
  Exception(const Exception&) noexcept = default;
  Exception& operator=(const Exception&) noexcept = default;
  /// @}
  ~Exception() override;
  /// A description of the exception; derived classes give their own.
  const char* what() const noexcept override;
};

}  // namespace Tarn
