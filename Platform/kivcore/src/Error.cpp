// Error reporting: ThrowError, its handler, and the error manager's
// exception handler.
#include <kivcore/Debug.h>
#include <kivcore/Error.h>

#include "ContractViolation.h"

#include <cstdio>
#include <memory>
#include <mutex>

namespace kivcore::config {

namespace {

using ErrorHandlerPtr = std::shared_ptr<const ErrorHandler>;
using ExceptionHandlerPtr = std::shared_ptr<const ErrorManager::ExceptionHandler>;

struct HandlerState {
  std::mutex mutex;
  ErrorHandlerPtr errorHandler;          // empty: throw Error; guarded by mutex
  ExceptionHandlerPtr exceptionHandler;  // empty: print to stderr; guarded by mutex
};

// Never destroyed, so that errors reported during static destruction still
// find it.
HandlerState& State() {
  static HandlerState* state = new HandlerState;
  return *state;
}

// Swaps the handler held in ioSlot under the lock; returns the previous one.
template <class Handler>
Handler Exchange(std::shared_ptr<const Handler>& ioSlot, Handler inHandler) {
  std::shared_ptr<const Handler> handler;
  if (inHandler) handler = std::make_shared<const Handler>(std::move(inHandler));
  HandlerState& state = State();
  {
    std::lock_guard<std::mutex> lock(state.mutex);
    ioSlot.swap(handler);
  }
  return handler ? *handler : Handler();
}

template <class Handler>
std::shared_ptr<const Handler> Current(const std::shared_ptr<const Handler>& inSlot) {
  HandlerState& state = State();
  std::lock_guard<std::mutex> lock(state.mutex);
  return inSlot;
}

// The display text of a key "$$$/path=display text": what follows the first
// '=', or the whole key when it has none.
std::string DisplayText(const std::string& inKey) {
  const std::string::size_type equals = inKey.find('=');
  return equals == std::string::npos ? inKey : inKey.substr(equals + 1);
}

// Forgets this thread's recorded contract violation on every way out of a
// custom error handler, so that it cannot end up in an unrelated later
// error. The handler itself may take it with TakeLastContractViolation.
struct ForgetViolation {
  ~ForgetViolation() {
    debug::detail::ContractViolation ignored;
    (void)debug::detail::TakeContractViolation(ignored);
  }
};

}  // namespace

Error::Error(ErrorReport inReport, const std::string& inWhat)
    : std::runtime_error(inWhat), mReport(std::move(inReport)) {}

ErrorHandler SetErrorHandler(ErrorHandler inHandler) {
  return Exchange(State().errorHandler, std::move(inHandler));
}

void ThrowError(ErrorLevel inLevel, const char* inKey, unsigned int inNumber, int inCode, bool inFlag,
                const ReplacementValue& /*inValue1*/, const ReplacementValue& /*inValue2*/,
                const ReplacementValue& /*inValue3*/, const ReplacementValue& /*inValue4*/) {
  ErrorReport report{inLevel, inKey != nullptr ? inKey : "", inNumber, inCode, inFlag};

  if (ErrorHandlerPtr handler = Current(State().errorHandler)) {
    ForgetViolation forget;
    (*handler)(report);
    return;
  }

  std::string what = DisplayText(report.key);
  debug::detail::ContractViolation violation;
  if (debug::detail::TakeContractViolation(violation)) {
    what += ": " + violation.condition + " in " + violation.function + " at " + violation.file + ":" +
            std::to_string(violation.line);
  }
  throw Error(std::move(report), what);
}

ErrorManager* ErrorManager::Get(bool /*inCreate*/) {
  static ErrorManager manager;
  return &manager;
}

ErrorManager::ExceptionHandler ErrorManager::SetExceptionHandler(ExceptionHandler inHandler) {
  return Exchange(State().exceptionHandler, std::move(inHandler));
}

namespace {

void PrintException(std::exception_ptr inException) noexcept {
  try {
    std::rethrow_exception(inException);
  } catch (const std::exception& e) {
    std::fprintf(stderr, "kivcore: exception in guarded call: %s\n", e.what());
  } catch (...) {
    std::fprintf(stderr, "kivcore: exception in guarded call: unknown exception\n");
  }
}

}  // namespace

void ErrorManager::HandleException(std::exception_ptr inException) noexcept {
  try {
    if (ExceptionHandlerPtr handler = Current(State().exceptionHandler)) {
      (*handler)(inException);
      return;
    }
  } catch (...) {
    // A handler that throws must not break the caller's guarantee of
    // returning normally; report the original exception the default way.
  }
  PrintException(inException);
}

}  // namespace kivcore::config
