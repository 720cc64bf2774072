// Test support for silent-failure reports (TarnMessaging/Diagnostics.h).
#pragma once

#include <TarnMessaging/Diagnostics.h>

namespace messaging_test {

// Holds silent-failure reports at one setting for its lifetime, with no call
// site remembered, and restores the previous setting. Suites that make the
// reported mistakes on purpose (an operation on a disposed station, Terminate
// with stations retained) hold them off; suites of the reports hold them on.
class SilentFailureReportsSetting {
public:
  explicit SilentFailureReportsSetting(Tarn::Diagnostics::SilentFailureReports inSetting)
      : mPrevious(Tarn::Diagnostics::SetSilentFailureReports(inSetting)) {
    Tarn::Diagnostics::ForgetReportedCallSites();
  }
  ~SilentFailureReportsSetting() { Tarn::Diagnostics::SetSilentFailureReports(mPrevious); }

private:
  const Tarn::Diagnostics::SilentFailureReports mPrevious;
};

}  // namespace messaging_test
