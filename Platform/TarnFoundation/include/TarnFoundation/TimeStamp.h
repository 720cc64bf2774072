/// @file
/// Tarn::TimeStamp: a point in time, in milliseconds of a steady clock.
///
/// @code{.cpp}
///   Tarn::TimeStamp now;
///   double ms = now.GetMilliSeconds();
///   Tarn::TimeStamp::SetClockForTesting([&] { return fakeMs; });  // tests
/// @endcode
///
/// Threading: a TimeStamp is a value. SetClockForTesting may be called from
/// any thread; time stamps made afterwards read the new clock.
#pragma once

#include <TarnFoundation/Export.h>

#include <functional>

namespace Tarn {

/// A point in time, in milliseconds of a steady clock. A value; the clock
/// may be replaced for tests from any thread.
class TARNFOUNDATION_API TimeStamp {
public:
  /// The current time.
  TimeStamp();
  /// The time, in milliseconds since an unspecified start.
  double GetMilliSeconds() const noexcept { return mMilliSeconds; }

  /// Every TimeStamp made afterwards reads inMilliSeconds; empty restores the
  /// real (steady) clock.
  static void SetClockForTesting(std::function<double()> inMilliSeconds);

private:
  double mMilliSeconds;
};

}  // namespace Tarn
