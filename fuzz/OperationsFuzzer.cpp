// libFuzzer driver of the operations harness (Messaging/tests/
// OperationsHarness.h): the input bytes make every choice of one sequence,
// and any disagreement with the model, leak or station outliving Terminate
// aborts with the operations that led there. The sanitizers catch the rest.
//
// Build and run: fuzz/run.sh [SECONDS].
#include "DiagnosticsTestSupport.h"
#include "OperationsHarness.h"

#include <fuzzer/FuzzedDataProvider.h>

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>

namespace {

class FuzzChoices : public operations_harness::Choices {
public:
  explicit FuzzChoices(const std::uint8_t* inData, std::size_t inSize) : mInput(inData, inSize) {}
  std::uint32_t Below(std::uint32_t inBound) override { return mInput.ConsumeIntegralInRange<std::uint32_t>(0, inBound - 1); }
  bool Exhausted() override { return mInput.remaining_bytes() == 0; }

private:
  FuzzedDataProvider mInput;
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* inData, std::size_t inSize) {
  // Sequences end with stations retained on purpose; the harness fails on any report.
  const messaging_test::SilentFailureReportsSetting quiet(Tarn::Diagnostics::SilentFailureReports::kOff);
  FuzzChoices choices(inData, inSize);
  const std::string failure = operations_harness::RunSequence(choices, 400);
  if (!failure.empty()) std::fprintf(stderr, "tarn_fuzz_operations: %s\n", failure.c_str()), std::abort();
  return 0;
}
