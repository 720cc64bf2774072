// Private to kivcore: the contract violation last recorded on a thread by
// debug::BreakAfterContractDialog, kept in parts so that ThrowError can word
// its message and TakeLastContractViolation can give the short form.
#pragma once

#include <string>

namespace kivcore::debug::detail {

struct ContractViolation {
  std::string condition;
  std::string function;
  std::string file;
  int line = 0;
};

// Moves this thread's recorded violation into outViolation and forgets it.
// False (and outViolation untouched) when none is recorded.
bool TakeContractViolation(ContractViolation& outViolation);

}  // namespace kivcore::debug::detail
