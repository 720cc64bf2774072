// A second source of the message suite: a message type named as one of the
// suite's own, in this source's anonymous namespace.
#include <TarnMessaging/MessageImpl.h>

namespace {
struct Progress : Tarn::MessageImpl<Progress> {
  double mFraction = 0.5;
};
}  // namespace

const Tarn::Message& OtherUnitProgress() {
  static const Progress sProgress;
  return sProgress;
}
