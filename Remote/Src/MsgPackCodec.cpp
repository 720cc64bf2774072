// The MessagePack codec: an envelope map and a map of fields by name.
#include <TarnMessaging/Remote/WireCodec.h>

#include <msgpack.hpp>

#include <cstring>
#include <limits>

namespace Tarn::Remote {

WireCodec::~WireCodec() = default;

namespace {

// The envelope's keys; one byte each, as every message carries them.
constexpr char kOrigin = 'o';
constexpr char kSequence = 's';
constexpr char kWireName = 'n';
constexpr char kVersion = 'v';
constexpr char kFields = 'f';
constexpr char kSnapshot = 'k';

// A packer stream appending to a string.
class StringStream {
public:
  explicit StringStream(std::string& ioOut) : mOut(ioOut) {}
  void write(const char* inBytes, std::size_t inSize) { mOut.append(inBytes, inSize); }

private:
  std::string& mOut;
};

using Packer = msgpack::packer<StringStream>;

void PackKey(Packer& ioPacker, const char* inKey, std::size_t inLength) {
  ioPacker.pack_str(static_cast<std::uint32_t>(inLength));
  ioPacker.pack_str_body(inKey, static_cast<std::uint32_t>(inLength));
}

class PackingWriter final : public FieldWriter {
public:
  explicit PackingWriter(Packer& ioPacker) : mPacker(ioPacker) {}
  void Begin(std::size_t inFieldCount) override { mPacker.pack_map(static_cast<std::uint32_t>(inFieldCount)); }
  void Signed(const char* inName, std::int64_t inValue) override {
    Key(inName);
    mPacker.pack_int64(inValue);
  }
  void Unsigned(const char* inName, std::uint64_t inValue) override {
    Key(inName);
    mPacker.pack_uint64(inValue);
  }
  void Real(const char* inName, double inValue) override {
    Key(inName);
    mPacker.pack_double(inValue);
  }
  void Boolean(const char* inName, bool inValue) override {
    Key(inName);
    if (inValue) {
      mPacker.pack_true();
    } else {
      mPacker.pack_false();
    }
  }
  void Text(const char* inName, const std::string& inValue) override {
    Key(inName);
    PackKey(mPacker, inValue.data(), inValue.size());
  }

private:
  void Key(const char* inName) { PackKey(mPacker, inName, std::strlen(inName)); }
  Packer& mPacker;
};

bool KeyIs(const msgpack::object& inKey, const char* inName, std::size_t inLength) {
  return inKey.type == msgpack::type::STR && inKey.via.str.size == inLength &&
         std::memcmp(inKey.via.str.ptr, inName, inLength) == 0;
}

bool IsUnsigned(const msgpack::object& inValue) { return inValue.type == msgpack::type::POSITIVE_INTEGER; }

// Reads fields out of a parsed map; a value that does not fit its field
// marks the whole message refused.
class MapReader final : public FieldReader {
public:
  explicit MapReader(const msgpack::object_map& inMap) : mMap(inMap) {}

  void Signed(const char* inName, std::int64_t& ioValue, std::int64_t inMin, std::int64_t inMax) override {
    const msgpack::object* value = Find(inName);
    if (value == nullptr) return;
    if (value->type == msgpack::type::POSITIVE_INTEGER && inMax >= 0 &&
        value->via.u64 <= static_cast<std::uint64_t>(inMax)) {
      ioValue = static_cast<std::int64_t>(value->via.u64);
    } else if (value->type == msgpack::type::NEGATIVE_INTEGER && value->via.i64 >= inMin) {
      ioValue = value->via.i64;
    } else {
      mRefused = true;
    }
  }
  void Unsigned(const char* inName, std::uint64_t& ioValue, std::uint64_t inMax) override {
    const msgpack::object* value = Find(inName);
    if (value == nullptr) return;
    if (IsUnsigned(*value) && value->via.u64 <= inMax) {
      ioValue = value->via.u64;
    } else {
      mRefused = true;
    }
  }
  void Real(const char* inName, double& ioValue) override {
    const msgpack::object* value = Find(inName);
    if (value == nullptr) return;
    switch (value->type) {
      case msgpack::type::FLOAT32:
      case msgpack::type::FLOAT64: ioValue = value->via.f64; break;
      case msgpack::type::POSITIVE_INTEGER: ioValue = static_cast<double>(value->via.u64); break;
      case msgpack::type::NEGATIVE_INTEGER: ioValue = static_cast<double>(value->via.i64); break;
      default: mRefused = true;
    }
  }
  void Boolean(const char* inName, bool& ioValue) override {
    const msgpack::object* value = Find(inName);
    if (value == nullptr) return;
    if (value->type == msgpack::type::BOOLEAN) {
      ioValue = value->via.boolean;
    } else {
      mRefused = true;
    }
  }
  void Text(const char* inName, std::string& ioValue) override {
    const msgpack::object* value = Find(inName);
    if (value == nullptr) return;
    if (value->type == msgpack::type::STR) {
      ioValue.assign(value->via.str.ptr, value->via.str.size);
    } else {
      mRefused = true;
    }
  }

  bool Refused() const noexcept { return mRefused; }

private:
  // Linear: a map holds at most DecodeLimits::mMaxFields entries.
  const msgpack::object* Find(const char* inName) const {
    const std::size_t length = std::strlen(inName);
    for (std::uint32_t i = 0; i < mMap.size; ++i) {
      if (KeyIs(mMap.ptr[i].key, inName, length)) return &mMap.ptr[i].val;
    }
    return nullptr;
  }

  const msgpack::object_map& mMap;
  bool mRefused = false;
};

class MsgPackCodec final : public WireCodec {
public:
  explicit MsgPackCodec(const DecodeLimits& inLimits) : mLimits(inLimits) {}

  void Encode(const Envelope& inEnvelope, const WireType& inType, const Message& inMessage,
              std::string& outBytes) const override {
    outBytes.clear();
    StringStream stream(outBytes);
    Packer packer(stream);
    packer.pack_map(inEnvelope.mSnapshot != 0 ? 6 : 5);
    PackKey(packer, &kOrigin, 1);
    packer.pack_uint64(inEnvelope.mOrigin);
    PackKey(packer, &kSequence, 1);
    packer.pack_uint64(inEnvelope.mSequence);
    PackKey(packer, &kWireName, 1);
    PackKey(packer, inType.mWireName, std::strlen(inType.mWireName));
    PackKey(packer, &kVersion, 1);
    packer.pack_uint32(inType.mVersion);
    if (inEnvelope.mSnapshot != 0) {
      PackKey(packer, &kSnapshot, 1);
      packer.pack_uint64(inEnvelope.mSnapshot);
    }
    PackKey(packer, &kFields, 1);
    PackingWriter writer(packer);
    inType.mWrite(inMessage, writer);
  }

  Decoded Decode(const void* inBytes, std::size_t inSize) const noexcept override {
    Decoded result;
    try {
      DecodeInto(static_cast<const char*>(inBytes), inSize, result);
    } catch (...) {
      // A parse error, a limit exceeded, or storage out while building the
      // message: not a message, whatever was read of it.
      result.mStatus = DecodeStatus::kMalformed;
      result.mMessage.reset();
    }
    return result;
  }

private:
  void DecodeInto(const char* inBytes, std::size_t inSize, Decoded& ioResult) const {
    if (inSize == 0 || inSize > mLimits.mMaxBytes) return;
    // Arrays, binary and extension values are no part of the format; maps
    // and strings are held to the limits before anything is allocated for
    // them.
    const msgpack::unpack_limit limit(0, mLimits.mMaxFields, mLimits.mMaxTextBytes, 0, 0, mLimits.mMaxDepth);
    std::size_t offset = 0;
    const msgpack::object_handle handle = msgpack::unpack(inBytes, inSize, offset, nullptr, nullptr, limit);
    if (offset != inSize) return;  // trailing bytes
    const msgpack::object& root = handle.get();
    if (root.type != msgpack::type::MAP) return;

    const msgpack::object* origin = nullptr;
    const msgpack::object* sequence = nullptr;
    const msgpack::object* name = nullptr;
    const msgpack::object* version = nullptr;
    const msgpack::object* fields = nullptr;
    const msgpack::object* snapshot = nullptr;
    for (std::uint32_t i = 0; i < root.via.map.size; ++i) {
      const msgpack::object_kv& entry = root.via.map.ptr[i];
      if (KeyIs(entry.key, &kOrigin, 1)) origin = &entry.val;
      if (KeyIs(entry.key, &kSequence, 1)) sequence = &entry.val;
      if (KeyIs(entry.key, &kWireName, 1)) name = &entry.val;
      if (KeyIs(entry.key, &kVersion, 1)) version = &entry.val;
      if (KeyIs(entry.key, &kFields, 1)) fields = &entry.val;
      if (KeyIs(entry.key, &kSnapshot, 1)) snapshot = &entry.val;
    }
    if (origin == nullptr || sequence == nullptr || !IsUnsigned(*origin) || !IsUnsigned(*sequence) ||
        (snapshot != nullptr && !IsUnsigned(*snapshot))) {
      return;
    }
    ioResult.mHasEnvelope = true;
    ioResult.mEnvelope.mOrigin = origin->via.u64;
    ioResult.mEnvelope.mSequence = sequence->via.u64;
    ioResult.mEnvelope.mSnapshot = snapshot != nullptr ? snapshot->via.u64 : 0;
    if (name == nullptr || name->type != msgpack::type::STR || version == nullptr || !IsUnsigned(*version) ||
        version->via.u64 > std::numeric_limits<std::uint32_t>::max() || fields == nullptr ||
        fields->type != msgpack::type::MAP) {
      return;
    }
    ioResult.mWireName.assign(name->via.str.ptr, name->via.str.size);
    ioResult.mVersion = static_cast<std::uint32_t>(version->via.u64);

    const WireType* type = FindWireType(name->via.str.ptr, name->via.str.size);
    if (type == nullptr) {
      ioResult.mStatus = DecodeStatus::kUnknownType;
      return;
    }
    if (type->mVersion != ioResult.mVersion) {
      ioResult.mStatus = DecodeStatus::kUnknownVersion;
      return;
    }
    std::unique_ptr<Message> message = type->mCreate();
    MapReader reader(fields->via.map);
    type->mRead(*message, reader);
    if (reader.Refused()) return;
    ioResult.mMessage = std::move(message);
    ioResult.mStatus = DecodeStatus::kDecoded;
  }

  const DecodeLimits mLimits;
};

}  // namespace

std::unique_ptr<WireCodec> MakeMsgPackCodec(const DecodeLimits& inLimits) {
  return std::make_unique<MsgPackCodec>(inLimits);
}

}  // namespace Tarn::Remote
