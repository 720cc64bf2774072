// The remote library's way of reporting a violated precondition, the same
// procedure as the messaging library's: the contract dialog with the
// condition's text and the check site, a break into an attached debugger if
// the dialog asks for it, then kivcore's ThrowError with the fixed
// contract-violation key. If ThrowError returns, the caller goes on: every
// check site is followed by code that stays safe with the bad input.
#pragma once

#include <kivcore/Debug.h>
#include <kivcore/Error.h>

#include <csignal>

#define TARN_REMOTE_CONTRACT_VIOLATION_KEY \
  "$$$/kivcore/utility/Error/Contract/InputContractViolation=An input contract violation has occurred!"

namespace Tarn::Remote::Detail {

// The report itself, for checks whose condition was tested elsewhere (one
// made outside a lock, say). May throw what the error handler throws.
inline void ReportContractViolation(const char* inCondition, const char* inFile, const char* inFunction,
                                    int inLine) {
  if (::kivcore::debug::BreakAfterContractDialog(inCondition, inFile, inFunction, inLine) &&
      ::kivcore::debug::IsDebuggerAttached()) {
    ::raise(SIGTRAP);
  }
  const ::kivcore::config::ReplacementValue value1, value2, value3, value4;
  ::kivcore::config::ThrowError(0, TARN_REMOTE_CONTRACT_VIOLATION_KEY, 105u, 25, true, value1, value2, value3,
                                value4);
}

}  // namespace Tarn::Remote::Detail

#define TARN_REMOTE_CONTRACT_CHECK(condition, function)                                          \
  do {                                                                                           \
    if (!(condition)) {                                                                          \
      ::Tarn::Remote::Detail::ReportContractViolation(#condition, __FILE__, function, __LINE__); \
    }                                                                                            \
  } while (false)
