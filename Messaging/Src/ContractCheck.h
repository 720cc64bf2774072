// The library's one way of reporting a violated precondition.
//
// TARN_CONTRACT_CHECK(condition, function) evaluates the condition once; when
// it is false it shows the contract dialog with the condition's text, this
// source file, the given qualified function name and this line, breaks into
// an attached debugger if the dialog asks for it (the break lands on the check
// site, since the macro expands there), and then calls ThrowError with the
// library's fixed contract-violation key. If ThrowError returns, the caller
// goes on: every check site is followed by code that stays safe with the bad
// input.
#pragma once

#include <kivcore/Debug.h>
#include <kivcore/Error.h>

#include <csignal>

#define TARN_CONTRACT_VIOLATION_KEY \
  "$$$/kivcore/utility/Error/Contract/InputContractViolation=An input contract violation has occurred!"

#define TARN_CONTRACT_CHECK(condition, function)                                                                \
  do {                                                                                                          \
    if (!(condition)) {                                                                                         \
      if (::kivcore::debug::BreakAfterContractDialog(#condition, __FILE__, function, __LINE__) &&               \
          ::kivcore::debug::IsDebuggerAttached()) {                                                             \
        ::raise(SIGTRAP);                                                                                       \
      }                                                                                                         \
      const ::kivcore::config::ReplacementValue tarnValue1, tarnValue2, tarnValue3, tarnValue4;                  \
      ::kivcore::config::ThrowError(0, TARN_CONTRACT_VIOLATION_KEY, 105u, 25, true, tarnValue1, tarnValue2,     \
                                    tarnValue3, tarnValue4);                                                    \
    }                                                                                                           \
  } while (false)
