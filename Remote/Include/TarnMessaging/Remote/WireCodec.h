/// @file
/// Tarn::Remote::WireCodec: turns a wire-enabled message and its envelope
/// (origin and sequence number) into bytes and back. The library's codec is
/// MessagePack in map mode (MakeMsgPackCodec); another (protobuf, say) plugs
/// in by implementing this interface and handing it to a Node.
///
/// @code{.cpp}
///   std::unique_ptr<Tarn::Remote::WireCodec> codec = Tarn::Remote::MakeMsgPackCodec();
///   std::string bytes;
///   codec->Encode({origin, 1}, Tarn::Remote::WireTypeOf<Progress>(), progress, bytes);
///   Tarn::Remote::Decoded in = codec->Decode(bytes.data(), bytes.size());
///   if (in.mStatus == Tarn::Remote::DecodeStatus::kDecoded) Use(*in.mMessage->As<Progress>());
/// @endcode
///
/// Every byte a decoder reads is untrusted: it bounds the input's size, its
/// nesting depth, the number of fields and the length of every string by its
/// DecodeLimits, and answers kMalformed for anything outside them or for
/// bytes that do not parse; it never throws and never reads past inSize.
/// A well-formed envelope naming a wire name this process has not
/// registered, or another version of one it has, is answered kUnknownType or
/// kUnknownVersion, with the envelope filled in so that the caller can still
/// account for the sequence number.
///
/// Threading: a codec holds no state between calls; one codec object may be
/// used by several threads at once. Decode reads the wire registry
/// (FindWireType).
#pragma once

#include <TarnMessaging/Message.h>
#include <TarnMessaging/Remote/Export.h>
#include <TarnMessaging/Remote/WireMessage.h>

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>

namespace Tarn::Remote {

/// Who sent a message and where it stands in that sender's sequence for its
/// station.
struct Envelope {
  std::uint64_t mOrigin = 0;    ///< the sending node's ID, random per node
  std::uint64_t mSequence = 0;  ///< 1 for the node's first message on the station, then one more each
  /// For a latest value sent again to an importer that (re)connected: the
  /// number of that sending, and mSequence is the last number the node sent
  /// on the station; 0 for every other message.
  std::uint64_t mSnapshot = 0;
};

/// The bounds a decoder holds untrusted input to.
struct DecodeLimits {
  std::size_t mMaxBytes = 64 * 1024;        ///< the whole encoded message
  std::size_t mMaxDepth = 4;                ///< nested containers, the envelope counting as one
  std::size_t mMaxFields = 64;              ///< entries of one map
  std::size_t mMaxTextBytes = 16 * 1024;    ///< one string
};

/// What a decode produced.
enum class DecodeStatus {
  kDecoded,         ///< mMessage holds the message
  kUnknownType,     ///< the wire name is not registered here; mWireName says which
  kUnknownVersion,  ///< the wire name is, with another version; mWireName and mVersion say which
  kMalformed,       ///< not a message: bytes that do not parse, exceed a limit, or miss or mistype a field
};

/// The result of WireCodec::Decode.
struct Decoded {
  DecodeStatus mStatus = DecodeStatus::kMalformed;  ///< what the bytes were
  bool mHasEnvelope = false;  ///< mEnvelope was read (every status but some kMalformed)
  Envelope mEnvelope;         ///< the sender and sequence, when mHasEnvelope
  std::string mWireName;      ///< empty when it was not read
  std::uint32_t mVersion = 0;  ///< the version read with mWireName
  std::unique_ptr<Message> mMessage;  ///< set for kDecoded only
};

/// Encodes and decodes wire-enabled messages; see the file comment.
class TARN_REMOTE_API WireCodec {
public:
  virtual ~WireCodec();

  /// Replaces outBytes with the encoding of inMessage, which is of the type
  /// inType describes, under inEnvelope. Throws std::bad_alloc only.
  virtual void Encode(const Envelope& inEnvelope, const WireType& inType, const Message& inMessage,
                      std::string& outBytes) const = 0;

  /// Decodes inSize bytes at inBytes (null when inSize is 0). Never throws.
  virtual Decoded Decode(const void* inBytes, std::size_t inSize) const noexcept = 0;
};

/// The MessagePack codec: an envelope map {"o": origin, "s": sequence,
/// "n": wire name, "v": version, "f": fields}, with "k": snapshot for a
/// latest value sent again, and the fields as a map from
/// each field's name to its value, so that peers match fields by name.
TARN_REMOTE_API std::unique_ptr<WireCodec> MakeMsgPackCodec(const DecodeLimits& inLimits = DecodeLimits());

}  // namespace Tarn::Remote
