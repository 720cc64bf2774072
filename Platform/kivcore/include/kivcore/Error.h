/// @file
/// kivcore::config error reporting: ThrowError and the error manager.
///
/// ThrowError hands what it was given to the error handler; the default
/// handler throws kivcore::config::Error. A host (or a test) installs its own
/// handler with SetErrorHandler; if that handler returns, ThrowError returns.
///
/// @code{.cpp}
///   auto previous = kivcore::config::SetErrorHandler(
///       [](const kivcore::config::ErrorReport& inReport) { Log(inReport.key); });
/// @endcode
///
/// ErrorManager::GuardedCall runs a call and hands any exception it raises to
/// the exception handler (by default, one line on standard error), so that the
/// caller always continues.
///
/// Threading: every function may be called from any thread; the Set functions
/// swap handlers atomically and return the previous one. Handlers run on the
/// reporting thread, with no lock of kivcore held.
#pragma once

#include <kivcore/Export.h>

#include <boost/function.hpp>

#include <exception>
#include <functional>
#include <stdexcept>
#include <string>

namespace kivcore::config {

/// The severity passed to ThrowError.
using ErrorLevel = int;

/// A substitution value for an error text; the library passes empty ones.
class KIVCORE_API ReplacementValue {
public:
  /// An empty value.
  ReplacementValue() = default;
  /// A value substituting inText.
  explicit ReplacementValue(std::string inText) : mText(std::move(inText)) {}
  /// Whether the value has no text.
  bool empty() const noexcept { return mText.empty(); }
  /// The text substituted.
  const std::string& Text() const noexcept { return mText; }

private:
  std::string mText;
};

/// What ThrowError was given, as the error handler receives it.
struct ErrorReport {
  int level;  ///< the error level
  std::string key;  ///< the whole key, "$$$/...=display text"
  unsigned int number;  ///< the error number
  int code;             ///< the error code
  bool flag;            ///< the flag argument of ThrowError
};

/// Thrown by the default error handler. what() gives the key's display text
/// (after the '=') and, after a failed contract check on this thread, the
/// condition, function, file and line of that check.
class KIVCORE_API Error : public std::runtime_error {
public:
  /// An error carrying inReport, with inWhat as its what() text.
  Error(ErrorReport inReport, const std::string& inWhat);
  /// What ThrowError was given.
  const ErrorReport& Report() const noexcept { return mReport; }

private:
  ErrorReport mReport;
};

/// Receives every report of ThrowError, on the reporting thread.
using ErrorHandler = std::function<void(const ErrorReport&)>;
/// Installs inHandler (empty: the default) and returns the previous handler.
KIVCORE_API ErrorHandler SetErrorHandler(ErrorHandler inHandler);

/// Reports an error through the current handler.
KIVCORE_API void ThrowError(ErrorLevel inLevel, const char* inKey, unsigned int inNumber, int inCode, bool inFlag,
                            const ReplacementValue& inValue1, const ReplacementValue& inValue2,
                            const ReplacementValue& inValue3, const ReplacementValue& inValue4);

/// The process's error manager: runs calls with their exceptions caught and
/// handed to an exception handler. Every function may be called from any
/// thread; handlers run on the calling thread.
class KIVCORE_API ErrorManager {
public:
  /// The process's error manager; never null. inCreate is accepted for
  /// compatibility and ignored.
  static ErrorManager* Get(bool inCreate);

  /// Calls inCall once, on this thread. An exception it raises is handed to
  /// the exception handler and 0 is returned; otherwise its result.
  int GuardedCall(const boost::function<int()>& inCall) noexcept;

  /// Receives each exception that GuardedCall catches.
  using ExceptionHandler = std::function<void(std::exception_ptr)>;
  /// Installs inHandler (empty: the default) and returns the previous one.
  static ExceptionHandler SetExceptionHandler(ExceptionHandler inHandler);

private:
  ErrorManager() = default;
  static void HandleException(std::exception_ptr inException) noexcept;
};

inline int ErrorManager::GuardedCall(const boost::function<int()>& inCall) noexcept {
  try {
    return inCall();
  } catch (...) {
    HandleException(std::current_exception());
    return 0;
  }
}

}  // namespace kivcore::config
