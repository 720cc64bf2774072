// Tarn::TimeStamp: a point in time, in milliseconds of a steady clock.
//
//   Tarn::TimeStamp now;
//   double ms = now.GetMilliSeconds();
//   Tarn::TimeStamp::SetClockForTesting([&] { return fakeMs; });  // tests
//
// Threading: a TimeStamp is a value. SetClockForTesting may be called from
// any thread; time stamps made afterwards read the new clock.
#pragma once

#include <TarnFoundation/Export.h>

#include <functional>

namespace Tarn {

class TARNFOUNDATION_API TimeStamp {
public:
  // The current time.
  TimeStamp();
  double GetMilliSeconds() const noexcept { return mMilliSeconds; }

  // Every TimeStamp made afterwards reads inMilliSeconds; empty restores the
  // real (steady) clock.
  static void SetClockForTesting(std::function<double()> inMilliSeconds);

private:
  double mMilliSeconds;
};

}  // namespace Tarn
