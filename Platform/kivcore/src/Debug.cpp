// Contract dialog hooks and debugger queries.
#include <kivcore/Debug.h>

#include "ContractViolation.h"

#include <csignal>
#include <cstddef>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <mutex>

namespace kivcore::debug {

namespace {

using HandlerPtr = std::shared_ptr<const ContractDialogHandler>;

struct DialogState {
  std::mutex mutex;
  HandlerPtr handler;  // empty: the default dialog; guarded by mutex
};

// Never destroyed, so that a contract check during static destruction still
// finds it.
DialogState& State() {
  static DialogState* state = new DialogState;
  return *state;
}

// The last violation seen on this thread, until ThrowError or
// TakeLastContractViolation takes it. Plain characters, so that it has no
// destructor: the main thread's thread_local objects with destructors are
// destroyed before static objects are, whose destructors may still report
// (the last Terminate made from one). Longer texts are cut.
struct RecordedViolation {
  char condition[512];
  char function[256];
  char file[512];
  int line;
  bool recorded;
};
thread_local RecordedViolation tLast;

template <std::size_t kSize>
void CopyCut(char (&outText)[kSize], const char* inText) noexcept {
  const std::size_t length = inText != nullptr ? strnlen(inText, kSize - 1) : 0;
  std::memcpy(outText, inText != nullptr ? inText : "", length);
  outText[length] = '\0';
}

}  // namespace

ContractDialogHandler SetContractDialogHandler(ContractDialogHandler inHandler) {
  HandlerPtr handler;
  if (inHandler) handler = std::make_shared<const ContractDialogHandler>(std::move(inHandler));
  DialogState& state = State();
  {
    std::lock_guard<std::mutex> lock(state.mutex);
    state.handler.swap(handler);
  }
  return handler ? *handler : ContractDialogHandler();
}

bool BreakAfterContractDialog(const char* inCondition, const char* inFile, const char* inFunction, int inLine) {
  RecordedViolation& last = tLast;
  CopyCut(last.condition, inCondition);
  CopyCut(last.function, inFunction);
  CopyCut(last.file, inFile);
  last.line = inLine;
  last.recorded = true;

  HandlerPtr handler;
  {
    DialogState& state = State();
    std::lock_guard<std::mutex> lock(state.mutex);
    handler = state.handler;
  }
  try {
    return handler ? (*handler)(inCondition, inFile, inFunction, inLine) : false;
  } catch (...) {
    // No ThrowError follows to take it, and a later, unrelated error must
    // not name it.
    last.recorded = false;
    throw;
  }
}

bool IsDebuggerAttached() {
  std::FILE* status = std::fopen("/proc/self/status", "r");
  if (status == nullptr) return false;
  bool attached = false;
  char line[256];
  while (std::fgets(line, sizeof line, status) != nullptr) {
    static constexpr char kTracer[] = "TracerPid:";
    if (std::strncmp(line, kTracer, sizeof kTracer - 1) == 0) {
      attached = std::strtol(line + sizeof kTracer - 1, nullptr, 10) != 0;
      break;
    }
  }
  std::fclose(status);
  return attached;
}

void BreakIntoDebugger() {
  // Without a tracer, SIGTRAP would end the process.
  if (IsDebuggerAttached()) std::raise(SIGTRAP);
}

std::string TakeLastContractViolation() {
  detail::ContractViolation violation;
  if (!detail::TakeContractViolation(violation)) return std::string();
  return violation.condition + ", " + violation.function + ", " + violation.file + ":" +
         std::to_string(violation.line);
}

bool detail::TakeContractViolation(ContractViolation& outViolation) {
  RecordedViolation& last = tLast;
  if (!last.recorded) return false;
  last.recorded = false;
  outViolation.condition = last.condition;
  outViolation.function = last.function;
  outViolation.file = last.file;
  outViolation.line = last.line;
  return true;
}

}  // namespace kivcore::debug
