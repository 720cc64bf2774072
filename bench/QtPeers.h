// The Qt 5 objects of the benchmarks: a sender whose signal carries the
// pair, and a receiver whose slot adds it into its Tally. Built with
// QT_NO_KEYWORDS, since Qt's "signals" and "emit" macros would rewrite
// Boost.Signals2 and libsigc++ code. Both live on the main thread.
#pragma once

#include "BenchSupport.h"

#include <QObject>

namespace TarnBench {

class QtSender : public QObject {
  Q_OBJECT
public:
Q_SIGNALS:
  void Pair(const TarnBench::PairArgs& inArgs);
};

class QtReceiver : public QObject {
  Q_OBJECT
public:
  explicit QtReceiver(Tally* inTally) noexcept : mTally(inTally) {}
public Q_SLOTS:
  void OnPair(const TarnBench::PairArgs& inArgs) { mTally->Add(inArgs.mA, inArgs.mB); }

private:
  Tally* mTally;  // not owned
};

}  // namespace TarnBench
