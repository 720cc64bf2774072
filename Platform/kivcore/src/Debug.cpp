// Contract dialog hooks and debugger queries.
#include <kivcore/Debug.h>

#include "ContractViolation.h"

#include <csignal>
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
// TakeLastContractViolation takes it.
struct RecordedViolation {
  detail::ContractViolation violation;
  bool recorded = false;
};
thread_local RecordedViolation tLast;

const char* OrEmpty(const char* inText) noexcept { return inText != nullptr ? inText : ""; }

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
  last.violation.condition.assign(OrEmpty(inCondition));
  last.violation.function.assign(OrEmpty(inFunction));
  last.violation.file.assign(OrEmpty(inFile));
  last.violation.line = inLine;
  last.recorded = true;

  HandlerPtr handler;
  {
    DialogState& state = State();
    std::lock_guard<std::mutex> lock(state.mutex);
    handler = state.handler;
  }
  return handler ? (*handler)(inCondition, inFile, inFunction, inLine) : false;
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
  outViolation = std::move(last.violation);
  return true;
}

}  // namespace kivcore::debug
