// The wire decoder's fuzz target: arbitrary bytes through the harness the
// codec suite drives with mutations of valid encodings (DecoderHarness.h).
// The seeds in corpus-wire/ are valid encodings of the test messages.
#include "DecoderHarness.h"
#include "RemoteTestMessages.h"

#include <cstddef>
#include <cstdint>

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* inData, std::size_t inSize) {
  static const auto sCodec = Tarn::Remote::MakeMsgPackCodec();
  remote_test::CheckDecode(*sCodec, inData, inSize);
  return 0;
}
