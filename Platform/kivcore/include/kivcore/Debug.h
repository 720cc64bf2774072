/// @file
/// kivcore::debug: the contract-violation dialog and debugger queries.
///
/// A library has no window, so the default dialog shows nothing: it remembers
/// the violation for the calling thread (ThrowError puts it into its message)
/// and answers false. A host or a test installs its own dialog handler.
///
/// Threading: every function may be called from any thread; handlers run on
/// the calling thread with no lock of kivcore held.
#pragma once

#include <kivcore/Export.h>

#include <functional>
#include <string>

namespace kivcore::debug {

/// Shows a failed contract check (condition, file, function, line) and
/// answers whether to break into the debugger.
using ContractDialogHandler =
    std::function<bool(const char* inCondition, const char* inFile, const char* inFunction, int inLine)>;
/// Installs inHandler (empty: the default) and returns the previous one.
KIVCORE_API ContractDialogHandler SetContractDialogHandler(ContractDialogHandler inHandler);

/// Shows the contract dialog; true when the user asks to break into the
/// debugger.
KIVCORE_API bool BreakAfterContractDialog(const char* inCondition, const char* inFile, const char* inFunction,
                                          int inLine);

/// True when a debugger (any tracer) is attached to the process.
KIVCORE_API bool IsDebuggerAttached();

/// Stops in the debugger; does nothing when none is attached.
KIVCORE_API void BreakIntoDebugger();

/// The last violation BreakAfterContractDialog saw on this thread, as
/// "condition, function, file:line", and forgets it. Empty when none.
KIVCORE_API std::string TakeLastContractViolation();

}  // namespace kivcore::debug
