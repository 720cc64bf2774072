// The status bar's station in tarn-demo: a plain Tarn::Station that, at each
// broadcast of a progress message, notes whether it is stopped. A stopped
// station drops what it is given; counting the drops where they happen lets
// the summary account for every message posted without trusting the
// listeners' own counts:
//
//   lost = posted - delivered - dropped while stopped
//
//   InstallMeteredStatusBar(&ledger);   // before Tarn::Messaging::Initialize
//   Tarn::Messaging::Initialize();      // keeps the registration made above
//   ... posted progress messages arrive ...
//   ledger.mDroppedWhileStopped
//
// Threading: broadcasts, and so the counts, happen on the main thread only;
// read the ledger there.
#pragma once

#include <TarnMessaging.h>

#include <cstdint>

namespace tarn_demo {

struct DropLedger {
  std::uint64_t mArrivedWhileBroadcasting = 0;  // main thread
  std::uint64_t mDroppedWhileStopped = 0;       // main thread
};

class MeteredStation : public Tarn::Station {
public:
  MeteredStation(const kivcore::utility::ImmutableString& inStationID, DropLedger& ioLedger);

  void BroadcastMessage(const Tarn::Message& inMessage) override;

private:
  DropLedger& mLedger;
};

// Registers kStation_StatusBar with a factory that makes a MeteredStation
// counting into *ioLedger. Call it before Tarn::Messaging::Initialize: the
// library registers its well-known stations only where no registration
// exists. *ioLedger must outlive the station (until Terminate).
void InstallMeteredStatusBar(DropLedger* ioLedger);

// Whether the station now registered as kStation_StatusBar is metered.
bool StatusBarIsMetered();

}  // namespace tarn_demo
