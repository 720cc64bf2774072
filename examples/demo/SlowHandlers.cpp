#include "SlowHandlers.h"

#include "TextFormat.h"

#include <TarnMessaging/Listener.h>

#include <algorithm>
#include <typeinfo>
#include <vector>

namespace tarn_demo {

namespace {

const char* KindName(Tarn::Tracing::ListenerKind inKind) {
  switch (inKind) {
    case Tarn::Tracing::ListenerKind::kPlain: return "plain";
    case Tarn::Tracing::ListenerKind::kSafe: return "safe listener";
    case Tarn::Tracing::ListenerKind::kBoostWeak: return "boost::weak_ptr listener";
    case Tarn::Tracing::ListenerKind::kStdWeak: return "std::weak_ptr listener";
  }
  return "listener";
}

double MilliSeconds(std::chrono::nanoseconds inTime) { return static_cast<double>(inTime.count()) / 1e6; }

}  // namespace

void SlowHandlers::DeliveryBegins(const Tarn::Tracing::Delivery& inDelivery) {
  // A plain listener is alive while its broadcaster is about to call it; by
  // the end of the delivery it may have deleted itself.
  mBeginning.clear();
  if (inDelivery.mListenerKind == Tarn::Tracing::ListenerKind::kPlain && inDelivery.mListener != nullptr) {
    mBeginning = Tarn::Tracing::ReadableTypeName(typeid(*static_cast<const Tarn::Listener*>(inDelivery.mListener)).name());
    // A subscription's listener type spells out its whole handler.
    const std::size_t arguments = mBeginning.find('<');
    if (arguments != std::string::npos) mBeginning.replace(arguments, std::string::npos, "<...>");
  }
}

void SlowHandlers::DeliveryEnded(const Tarn::Tracing::Delivery& inDelivery, std::chrono::nanoseconds inDuration) {
  ++mDeliveries;
  const Key key{inDelivery.mListener, inDelivery.mStationID.empty() ? "" : inDelivery.mStationID.c_str(),
                inDelivery.mMessageType};
  Figures& figures = mHandlers[key];
  if (figures.mCalls++ == 0) {
    char address[32];
    std::snprintf(address, sizeof address, "%p", inDelivery.mListener);
    figures.mListener = mBeginning.empty() ? std::string(KindName(inDelivery.mListenerKind)) + " " + address
                                           : mBeginning + " " + address;
  }
  figures.mTotal += inDuration;
  figures.mLongest = std::max(figures.mLongest, inDuration);
}

void SlowHandlers::Print(std::FILE* inStream) const {
  std::vector<std::pair<const Key*, const Figures*>> slow;
  for (const auto& handler : mHandlers) {
    if (handler.second.mLongest >= mThreshold) slow.emplace_back(&handler.first, &handler.second);
  }
  std::sort(slow.begin(), slow.end(), [](const auto& inA, const auto& inB) {
    return inA.second->mLongest > inB.second->mLongest;
  });
  std::fprintf(inStream, "\nslowest handlers (%s deliveries traced; %zu of %zu handlers took %lld ms or more)\n",
               WithSeparators(mDeliveries).c_str(), slow.size(), mHandlers.size(),
               static_cast<long long>(mThreshold.count()));
  if (slow.empty()) return;
  std::fprintf(inStream, "  %10s %10s %10s %10s  %-26s %-30s %s\n", "max ms", "mean ms", "total ms", "calls", "station",
               "message", "listener");
  for (std::size_t i = 0; i < slow.size() && i < 10; ++i) {
    const Figures& figures = *slow[i].second;
    const std::string& station = std::get<1>(*slow[i].first);
    std::fprintf(inStream, "  %10.3f %10.3f %10.1f %10s  %-26s %-30s %s\n", MilliSeconds(figures.mLongest),
                 MilliSeconds(figures.mTotal) / static_cast<double>(figures.mCalls), MilliSeconds(figures.mTotal),
                 WithSeparators(figures.mCalls).c_str(), station.empty() ? "(broadcaster)" : station.c_str(),
                 Tarn::Tracing::ReadableTypeName(std::get<2>(*slow[i].first)).c_str(), figures.mListener.c_str());
  }
}

}  // namespace tarn_demo
