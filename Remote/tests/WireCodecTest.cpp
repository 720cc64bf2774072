// The wire codec: fields matched by name between peers of different
// definitions, and untrusted bytes refused within bounds, never a crash.
#include "DecoderHarness.h"
#include "RemoteTestMessages.h"

#include <TarnMessaging/Remote/WireCodec.h>

#include <kivcore/Error.h>

#include <gtest/gtest.h>

#include <cstring>
#include <limits>
#include <random>
#include <string>

namespace {

using remote_test::Progress;
using Tarn::Remote::DecodeStatus;
using Tarn::Remote::Envelope;
using Tarn::Remote::FieldWriter;
using Tarn::Remote::WireType;

// What a peer built against another definition of test.progress writes:
// mDone as inDone (a field both know), mLabel missing, a field this process
// does not know, and the version it was built with.
struct OtherPeer {
  static inline std::uint32_t sVersion = 1;
  static inline const char* sWireName = "test.progress";
  static inline bool sDoneAsText = false;
  static void Write(const Tarn::Message&, FieldWriter& ioWriter) {
    ioWriter.Begin(2);
    if (sDoneAsText) {
      ioWriter.Text("mDone", "seven");
    } else {
      ioWriter.Signed("mDone", 7);
    }
    ioWriter.Text("mAddedLater", "ignored");
  }
  static std::string Encode(const Tarn::Remote::WireCodec& inCodec) {
    const WireType type{sWireName, sVersion, &Progress::StaticMessageID, nullptr, &Write, nullptr};
    std::string bytes;
    inCodec.Encode(Envelope{42, 9}, type, Progress(), bytes);
    return bytes;
  }
};

TEST(WireCodec, FieldsTravelByNameSoPeersOfOtherDefinitionsDecodeWhatBothKnow) {
  const auto codec = Tarn::Remote::MakeMsgPackCodec();
  Progress sent;
  sent.mDone = std::numeric_limits<std::int32_t>::min();
  sent.mSmall = 255;
  sent.mBig = std::numeric_limits<std::uint64_t>::max();
  sent.mRatio = -0.25;
  sent.mFinal = true;
  sent.mPhase = remote_test::Phase::kDone;
  sent.mLabel = std::string("nul\0inside", 10);
  std::string bytes;
  codec->Encode(Envelope{0xfeedfacecafebeefULL, 3, 2}, Tarn::Remote::WireTypeOf<Progress>(), sent, bytes);
  Tarn::Remote::Decoded got = codec->Decode(bytes.data(), bytes.size());
  ASSERT_EQ(got.mStatus, DecodeStatus::kDecoded);
  EXPECT_EQ(got.mEnvelope.mOrigin, 0xfeedfacecafebeefULL);
  EXPECT_EQ(got.mEnvelope.mSequence, 3u);
  EXPECT_EQ(got.mEnvelope.mSnapshot, 2u);
  const Progress* progress = got.mMessage->As<Progress>();
  ASSERT_NE(progress, nullptr);
  EXPECT_EQ(progress->mDone, sent.mDone);
  EXPECT_EQ(progress->mSmall, sent.mSmall);
  EXPECT_EQ(progress->mBig, sent.mBig);
  EXPECT_EQ(progress->mRatio, sent.mRatio);
  EXPECT_EQ(progress->mFinal, sent.mFinal);
  EXPECT_EQ(progress->mPhase, sent.mPhase);
  EXPECT_EQ(progress->mLabel, sent.mLabel);

  // A newer or older peer: the known field decodes, the missing one keeps its
  // default, the unknown one is skipped.
  bytes = OtherPeer::Encode(*codec);
  got = codec->Decode(bytes.data(), bytes.size());
  ASSERT_EQ(got.mStatus, DecodeStatus::kDecoded);
  EXPECT_EQ(got.mMessage->As<Progress>()->mDone, 7);
  EXPECT_EQ(got.mMessage->As<Progress>()->mLabel, "");

  // A field of the wrong kind refuses the message, with its envelope kept
  // for sequence accounting; so does a value out of its field's range.
  OtherPeer::sDoneAsText = true;
  bytes = OtherPeer::Encode(*codec);
  OtherPeer::sDoneAsText = false;
  got = codec->Decode(bytes.data(), bytes.size());
  EXPECT_EQ(got.mStatus, DecodeStatus::kMalformed);
  EXPECT_TRUE(got.mHasEnvelope);
  EXPECT_EQ(got.mEnvelope.mSequence, 9u);
  EXPECT_EQ(got.mMessage, nullptr);
  // One wrong field of each kind: out of range, or of another kind.
  using Write = void (*)(const Tarn::Message&, FieldWriter&);
  const Write wrongFields[] = {
      [](const Tarn::Message&, FieldWriter& ioWriter) { ioWriter.Begin(1); ioWriter.Unsigned("mSmall", 256); },
      [](const Tarn::Message&, FieldWriter& ioWriter) { ioWriter.Begin(1); ioWriter.Signed("mSmall", -1); },
      [](const Tarn::Message&, FieldWriter& ioWriter) { ioWriter.Begin(1); ioWriter.Unsigned("mDone", 1u << 31); },
      [](const Tarn::Message&, FieldWriter& ioWriter) { ioWriter.Begin(1); ioWriter.Signed("mLabel", 5); },
      [](const Tarn::Message&, FieldWriter& ioWriter) { ioWriter.Begin(1); ioWriter.Text("mFinal", "yes"); },
      [](const Tarn::Message&, FieldWriter& ioWriter) { ioWriter.Begin(1); ioWriter.Boolean("mRatio", true); }};
  for (const Write write : wrongFields) {
    codec->Encode(Envelope{1, 1}, WireType{"test.progress", 1, &Progress::StaticMessageID, nullptr, write, nullptr},
                  Progress(), bytes);
    EXPECT_EQ(codec->Decode(bytes.data(), bytes.size()).mStatus, DecodeStatus::kMalformed);
  }

  // Another version, and a name nobody registered here.
  OtherPeer::sVersion = 2;
  bytes = OtherPeer::Encode(*codec);
  got = codec->Decode(bytes.data(), bytes.size());
  EXPECT_EQ(got.mStatus, DecodeStatus::kUnknownVersion);
  EXPECT_EQ(got.mVersion, 2u);
  EXPECT_EQ(got.mWireName, "test.progress");
  OtherPeer::sVersion = 1;
  OtherPeer::sWireName = "test.nobody";
  bytes = OtherPeer::Encode(*codec);
  OtherPeer::sWireName = "test.progress";
  got = codec->Decode(bytes.data(), bytes.size());
  EXPECT_EQ(got.mStatus, DecodeStatus::kUnknownType);
  EXPECT_EQ(got.mWireName, "test.nobody");
  EXPECT_EQ(got.mEnvelope.mOrigin, 42u);
}

TEST(WireCodec, UntrustedBytesAreRefusedWithinTheLimitsNeverACrash) {
  Tarn::Remote::DecodeLimits limits;
  limits.mMaxBytes = 512;
  const auto codec = Tarn::Remote::MakeMsgPackCodec(limits);
  Progress sent;
  sent.mLabel = "label";
  std::string valid;
  codec->Encode(Envelope{5, 6}, Tarn::Remote::WireTypeOf<Progress>(), sent, valid);

  // Every truncation, and every one-byte change, through the harness the
  // fuzz target runs.
  for (std::size_t size = 0; size < valid.size(); ++size) {
    EXPECT_NE(remote_test::CheckDecode(*codec, valid.data(), size), DecodeStatus::kDecoded) << size;
  }
  std::mt19937 random(7);
  for (std::size_t at = 0; at < valid.size(); ++at) {
    for (int round = 0; round < 8; ++round) {
      std::string changed = valid;
      changed[at] = static_cast<char>(random());
      remote_test::CheckDecode(*codec, changed.data(), changed.size());
    }
  }

  const auto decode = [&](const std::string& inBytes) { return codec->Decode(inBytes.data(), inBytes.size()).mStatus; };
  EXPECT_EQ(decode(valid + '\xc0'), DecodeStatus::kMalformed) << "trailing bytes";
  std::string big = valid;
  big.resize(limits.mMaxBytes + 1, '\xc0');
  EXPECT_EQ(decode(big), DecodeStatus::kMalformed) << "over the size limit";
  // Map and string headers declaring four billion entries in a few bytes:
  // refused before anything is allocated for them.
  EXPECT_EQ(decode(std::string("\xdf\xff\xff\xff\xff", 5)), DecodeStatus::kMalformed);
  EXPECT_EQ(decode(std::string("\x81\xa1o\xdb\xff\xff\xff\xff", 8)), DecodeStatus::kMalformed);
  EXPECT_EQ(decode(std::string("\xdd\xff\xff\xff\xff", 5)), DecodeStatus::kMalformed) << "arrays are no part of it";
  std::string deep;
  for (int level = 0; level < 200; ++level) deep += "\x81\xa1" "f";
  deep += '\xc0';
  EXPECT_EQ(decode(deep), DecodeStatus::kMalformed) << "nested past the depth limit";
  EXPECT_EQ(codec->Decode(nullptr, 0).mStatus, DecodeStatus::kMalformed);
}

TEST(WireCodec, ASecondTypeClaimingARegisteredWireNameIsReportedAndTheFirstKeepsIt) {
  struct Impostor : Tarn::MessageImpl<Impostor> {};
  const WireType impostor{"test.progress", 1, &Impostor::StaticMessageID, nullptr, nullptr, nullptr};
  std::string reported;
  const auto previous = kivcore::config::SetErrorHandler(
      [&](const kivcore::config::ErrorReport& inReport) { reported = inReport.key; });
  EXPECT_TRUE(Tarn::Remote::RegisterWireType(impostor));
  kivcore::config::SetErrorHandler(previous);
  EXPECT_NE(reported.find("InputContractViolation"), std::string::npos);
  EXPECT_EQ(Tarn::Remote::FindWireType("test.progress", 13), &Tarn::Remote::WireTypeOf<Progress>());
  EXPECT_EQ(Tarn::Remote::FindWireType(Impostor::StaticMessageID()), nullptr);
}

}  // namespace
