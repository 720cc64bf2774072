// The decoder's one harness, with two drivers: the codec suite runs it over
// mutations of valid encodings, and the libFuzzer target over generated
// bytes. Whatever the input, a decode must not crash, and its result must
// hold together: a decoded message is of the registered type its wire name
// names, and encoding it again under the same envelope decodes to the same
// bytes (nothing was half read).
#pragma once

#include <TarnMessaging/Remote/WireCodec.h>

#include <cstdio>
#include <cstdlib>
#include <string>

namespace remote_test {

// Returns the decode's status; aborts, naming the broken rule, when the
// result does not hold together.
inline Tarn::Remote::DecodeStatus CheckDecode(const Tarn::Remote::WireCodec& inCodec, const void* inBytes,
                                              std::size_t inSize) {
  using Tarn::Remote::DecodeStatus;
  const auto fail = [](const char* inRule) {
    std::fprintf(stderr, "decoder harness: %s\n", inRule);
    std::abort();
  };
  const Tarn::Remote::Decoded decoded = inCodec.Decode(inBytes, inSize);
  if ((decoded.mMessage != nullptr) != (decoded.mStatus == DecodeStatus::kDecoded)) {
    fail("a message is returned exactly when the status is kDecoded");
  }
  if (decoded.mStatus != DecodeStatus::kMalformed && !decoded.mHasEnvelope) {
    fail("every status but kMalformed comes with its envelope");
  }
  if (decoded.mStatus != DecodeStatus::kDecoded) return decoded.mStatus;
  const Tarn::Remote::WireType* type = Tarn::Remote::FindWireType(decoded.mWireName.data(), decoded.mWireName.size());
  if (type == nullptr || type->mMessageID() != decoded.mMessage->GetMessageID()) {
    fail("a decoded message is of the type its wire name is registered for");
  }
  std::string once;
  std::string twice;
  inCodec.Encode(decoded.mEnvelope, *type, *decoded.mMessage, once);
  const Tarn::Remote::Decoded again = inCodec.Decode(once.data(), once.size());
  if (again.mStatus != DecodeStatus::kDecoded) fail("a decoded message encodes to a decodable one");
  inCodec.Encode(again.mEnvelope, *type, *again.mMessage, twice);
  if (once != twice) fail("encoding is stable across a decode");
  return decoded.mStatus;
}

}  // namespace remote_test
