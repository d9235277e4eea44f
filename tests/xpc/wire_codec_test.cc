// The wire codec: every type survives a round trip bit for bit, every rule
// of the format refuses what breaks it, and no cut of a valid frame decodes.
#include <algorithm>
#include <cmath>
#include <cstring>
#include <limits>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "xpc/frame_assembler.h"
#include "xpc/message_validator.h"
#include "xpc/wire_codec.h"

namespace vtr {
namespace {

// The validator's verdict on body, fed in pieces of the given size.
Status Validate(std::span<const uint8_t> body, size_t piece) {
  MessageValidator validator;
  validator.start(static_cast<uint32_t>(body.size()));
  for (size_t at = 0; at < body.size(); at += piece) {
    if (Status s = validator.feed(body.subspan(at, std::min(piece, body.size() - at))); !s.ok()) return s;
  }
  return validator.finish();
}

// Little helper to spell out hostile bodies byte by byte.
class Body {
 public:
  Body& u8(uint8_t v) {
    bytes_.push_back(v);
    return *this;
  }
  Body& u32(uint32_t v) {
    for (int i = 0; i < 4; ++i) bytes_.push_back(static_cast<uint8_t>(v >> (8 * i)));
    return *this;
  }
  Body& text(const std::string& s) {
    u32(static_cast<uint32_t>(s.size()));
    bytes_.insert(bytes_.end(), s.begin(), s.end());
    return *this;
  }
  Body& dict(uint32_t count) { return u8(0x0A).u32(count); }
  Body& array(uint32_t count) { return u8(0x09).u32(count); }
  const XpcBytes& bytes() const { return bytes_; }

 private:
  XpcBytes bytes_;
};

XpcBytes BodyOf(const XpcObject& message) {
  Result<XpcBytes> frame = EncodeFrame(message);
  EXPECT_TRUE(frame.ok()) << frame.error().description();
  if (!frame) return {};
  return XpcBytes(frame->begin() + kFrameHeaderBytes, frame->end());
}

XpcObject Sample() {
  double nan;
  uint64_t nanBits = 0x7ff8dead0000beefULL;
  std::memcpy(&nan, &nanBits, sizeof nan);
  return XpcObject::Dictionary({
      {"null", XpcObject::Null()},
      {"yes", XpcObject::Bool(true)},
      {"no", XpcObject::Bool(false)},
      {"min", XpcObject::Int64(std::numeric_limits<int64_t>::min())},
      {"max", XpcObject::Uint64(std::numeric_limits<uint64_t>::max())},
      {"pi", XpcObject::Double(3.14159)},
      {"nan", XpcObject::Double(nan)},
      {"negzero", XpcObject::Double(-0.0)},
      {"before1970", XpcObject::Date(-1'234'567'890'123)},
      {"data", XpcObject::Data({0, 1, 2, 0xff})},
      {"empty", XpcObject::Data({})},
      {"text", XpcObject::String("h\xc3\xa9llo")},
      {"not utf-8 \xff", XpcObject::String("\xc3(")},
      {"uuid", XpcObject::Uuid({1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11, 12, 13, 14, 15, 16})},
      {"list", XpcObject::Array({XpcObject::Int64(1), XpcObject::Array({}), XpcObject::Dictionary({})})},
      {"nested", XpcObject::Dictionary({{"Path", XpcObject::String("/private/var")}})},
  });
}

TEST(WireCodecTest, EveryTypeRoundTripsExactly) {
  XpcObject message = Sample();
  XpcBytes body = BodyOf(message);
  Result<XpcObject> decoded = DecodeMessage(body);
  ASSERT_TRUE(decoded.ok()) << decoded.error().description();
  EXPECT_EQ(*decoded, message);
  // Entry order is the wire order, and decoding then encoding is the identity.
  EXPECT_EQ(decoded->dictionary()->begin()->first, "null");
  EXPECT_EQ(BodyOf(*decoded), body);
  EXPECT_NE(*decoded, XpcObject::Dictionary({}));
}

TEST(WireCodecTest, EncodesTheDocumentedLayout) {
  Result<XpcBytes> frame = EncodeFrame(XpcObject::Dictionary({{"Progress", XpcObject::Int64(-2)}}));
  ASSERT_TRUE(frame.ok());
  XpcBytes expected = Body().u32(26).dict(1).text("Progress").u8(0x02).bytes();
  for (int i = 0; i < 8; ++i) expected.push_back(i == 0 ? 0xfe : 0xff);
  EXPECT_EQ(*frame, expected);
}

TEST(WireCodecTest, RefusesEveryBrokenRule) {
  XpcBytes deep;
  for (int i = 0; i < kMaxMessageDepth; ++i) {
    XpcBytes level = Body().dict(1).text("k").bytes();
    deep.insert(deep.end(), level.begin(), level.end());
  }
  deep.push_back(0x00);  // 64 nested dictionaries: allowed
  XpcBytes tooDeep = Body().dict(1).text("k").bytes();
  tooDeep.insert(tooDeep.end(), deep.begin(), deep.end());
  ASSERT_TRUE(DecodeMessage(deep).ok()) << DecodeMessage(deep).error().description();

  struct Case {
    const char* name;
    XpcBytes body;
    const char* error;
  };
  const Case cases[] = {
      {"empty body", {}, "empty body"},
      {"top level array", Body().array(0).bytes(), "not a dictionary"},
      {"top level string", Body().u8(0x07).text("x").bytes(), "not a dictionary"},
      {"unknown tag", Body().dict(1).text("k").u8(0x0B).bytes(), "unknown tag 0x0b at offset 10"},
      {"tag 0xff", Body().dict(1).text("k").u8(0xFF).bytes(), "unknown tag 0xff"},
      {"bool byte 2", Body().dict(1).text("k").u8(0x01).u8(2).bytes(), "bool byte 0x02"},
      {"truncated int64", Body().dict(1).text("k").u8(0x02).u32(0).bytes(), "truncated int64"},
      {"truncated uuid", Body().dict(1).text("k").u8(0x08).u32(0).bytes(), "truncated uuid"},
      {"data longer than body", Body().dict(1).text("k").u8(0x06).u32(5).u8(1).bytes(), "truncated data"},
      {"key longer than body", Body().dict(1).u32(100).u8('k').bytes(), "truncated key"},
      {"count beyond body", Body().dict(0xFFFFFFFF).bytes(), "dictionary count 4294967295 exceeds"},
      {"array count beyond body", Body().dict(1).text("k").array(7).u8(0).bytes(), "array count 7 exceeds"},
      {"bytes left over", Body().dict(0).u8(0).bytes(), "1 bytes left over"},
      {"NUL in key", Body().dict(1).text(std::string("a\0b", 3)).u8(0).bytes(), "NUL byte in a key at offset 10"},
      {"NUL in string", Body().dict(1).text("k").u8(0x07).text(std::string("\0", 1)).bytes(), "NUL byte in a string"},
      {"duplicate key", Body().dict(2).text("k").u8(0).text("k").u8(1).u8(1).bytes(), "duplicate key"},
      {"duplicate nested", Body().dict(1).text("d").dict(2).text("a").u8(0).text("a").u8(0).bytes(), "duplicate key"},
      {"nesting 65", tooDeep, "nesting deeper than 64"},
  };
  for (const Case& c : cases) {
    Result<XpcObject> decoded = DecodeMessage(c.body);
    ASSERT_FALSE(decoded.ok()) << c.name;
    EXPECT_NE(decoded.error().message().find(c.error), std::string::npos)
        << c.name << ": " << decoded.error().message();
    // The streaming validator refuses the same bodies, duplicate keys apart
    // (they need the keys kept), fed in one piece or byte by byte.
    if (c.body.empty() || std::string(c.name).find("duplicate") != std::string::npos) continue;
    EXPECT_FALSE(Validate(c.body, c.body.size()).ok()) << c.name;
    EXPECT_FALSE(Validate(c.body, 1).ok()) << c.name;
  }
  EXPECT_TRUE(Validate(deep, 1).ok());
}

TEST(MessageValidatorTest, AgreesWithTheDecoderOnEveryOneByteChangeAndCut) {
  const XpcBytes body = BodyOf(Sample());
  ASSERT_TRUE(Validate(body, 3).ok());
  for (size_t at = 0; at < body.size(); ++at) {
    EXPECT_FALSE(Validate(std::span(body.data(), at), 2).ok()) << "cut at " << at;
    for (const uint8_t change : {uint8_t{0x01}, uint8_t{0x80}, uint8_t{0xFF}}) {
      XpcBytes changed = body;
      changed[at] ^= change;
      const bool decodes = DecodeMessage(changed).ok();
      EXPECT_EQ(Validate(changed, 7).ok(), decodes) << "byte " << at << " ^ " << int{change};
    }
  }
}

TEST(MessageValidatorTest, DecodeCostBoundsWhatDenseMessagesWouldTake) {
  // Sparse: a 64 KiB string costs about its bytes.
  const XpcBytes text = BodyOf(XpcObject::Dictionary({{"k", XpcObject::String(std::string(64 << 10, 'x'))}}));
  MessageValidator validator;
  validator.start(static_cast<uint32_t>(text.size()));
  ASSERT_TRUE(validator.feed(text).ok());
  EXPECT_LE(validator.decodeCost(), MaxDecodeCost(static_cast<uint32_t>(text.size())));
  // Dense: an array of a million nulls costs an object a byte.
  XpcBytes nulls = Body().dict(1).text("k").array(1 << 20).bytes();
  nulls.resize(nulls.size() + (1 << 20), 0x00);
  validator.start(static_cast<uint32_t>(nulls.size()));
  ASSERT_TRUE(validator.feed(nulls).ok());
  ASSERT_TRUE(validator.finish().ok());
  EXPECT_GE(validator.decodeCost(), uint64_t{sizeof(XpcObject)} << 20);
  EXPECT_GT(validator.decodeCost(), MaxDecodeCost(static_cast<uint32_t>(nulls.size())));
}

TEST(WireCodecTest, NoCutOfAValidBodyDecodes) {
  XpcBytes body = BodyOf(Sample());
  for (size_t length = 0; length < body.size(); ++length) {
    EXPECT_FALSE(DecodeMessage(std::span(body.data(), length)).ok()) << "cut at " << length;
  }
}

TEST(WireCodecTest, FrameLengthMustBeOneTo16MiB) {
  auto header = [](uint32_t n) { return std::array<uint8_t, 4>{uint8_t(n), uint8_t(n >> 8), uint8_t(n >> 16), uint8_t(n >> 24)}; };
  EXPECT_FALSE(DecodeFrameLength(header(0)).ok());
  EXPECT_EQ(*DecodeFrameLength(header(1)), 1u);
  EXPECT_EQ(*DecodeFrameLength(header(kMaxFrameBodyBytes)), kMaxFrameBodyBytes);
  EXPECT_FALSE(DecodeFrameLength(header(kMaxFrameBodyBytes + 1)).ok());
  EXPECT_FALSE(DecodeFrameLength(header(0xFFFFFFFF)).ok());
}

TEST(WireCodecTest, EncoderRefusesWhatTheDecoderWould) {
  XpcObject deep = XpcObject::Int64(1);
  for (int i = 0; i < kMaxMessageDepth; ++i) deep = XpcObject::Dictionary({{"k", deep}});
  EXPECT_TRUE(EncodeFrame(deep).ok());
  XpcObject tooDeep = XpcObject::Dictionary({{"k", deep}});

  const std::pair<const char*, XpcObject> cases[] = {
      {"not a dictionary", XpcObject::Array({})},
      {"null message", XpcObject::Null()},
      {"NUL in key", XpcObject::Dictionary({{std::string("a\0", 2), XpcObject::Null()}})},
      {"NUL in string", XpcObject::Dictionary({{"k", XpcObject::String(std::string("\0", 1))}})},
      {"too deep", tooDeep},
      {"too large", XpcObject::Dictionary({{"Data", XpcObject::Data(XpcBytes(kMaxFrameBodyBytes))}})},
  };
  for (const auto& [name, message] : cases) EXPECT_FALSE(EncodeFrame(message).ok()) << name;
}

TEST(XpcObjectTest, DictionaryKeysStayUniqueAndOrdered) {
  XpcDictionary dict{{"b", XpcObject::Int64(1)}, {"a", XpcObject::Int64(2)}, {"b", XpcObject::Int64(3)}};
  ASSERT_EQ(dict.size(), 2u);
  EXPECT_EQ(dict.begin()->first, "b");
  EXPECT_EQ(*dict.find("b"), XpcObject::Int64(3));
  EXPECT_EQ(dict.find("c"), nullptr);
  EXPECT_FALSE(XpcDictionary::FromUniqueEntries({{"x", XpcObject()}, {"y", XpcObject()}, {"x", XpcObject()}}));
  // Types never convert into one another.
  EXPECT_NE(XpcObject::Int64(1), XpcObject::Uint64(1));
  EXPECT_NE(XpcObject::Int64(5), XpcObject::Date(5));
  EXPECT_FALSE(XpcObject::Bool(true).int64Value());
}

TEST(FrameAssemblerTest, CutsAStreamFedInAnyPieces) {
  XpcBytes stream;
  std::vector<XpcObject> messages = {Sample(), XpcObject::Dictionary({{"Response", XpcObject::Bool(true)}})};
  for (const XpcObject& message : messages) {
    XpcBytes frame = *EncodeFrame(message);
    stream.insert(stream.end(), frame.begin(), frame.end());
  }
  for (size_t piece : {size_t{1}, size_t{3}, size_t{7}, stream.size()}) {
    FrameAssembler assembler;
    std::vector<XpcObject> received;
    for (size_t at = 0; at < stream.size(); at += piece) {
      std::span<const uint8_t> chunk(stream.data() + at, std::min(piece, stream.size() - at));
      while (!chunk.empty()) {
        Result<size_t> used = assembler.consume(chunk);
        ASSERT_TRUE(used.ok());
        chunk = chunk.subspan(*used);
        if (assembler.frameComplete()) received.push_back(*DecodeMessage(assembler.takeFrame()));
      }
      // Never more held than what has arrived of the frame in progress.
      EXPECT_LE(assembler.bufferedBytes(), at + piece);
    }
    EXPECT_EQ(received, messages) << "pieces of " << piece;
    EXPECT_FALSE(assembler.midFrame());
  }
}

TEST(FrameAssemblerTest, RefusesABadHeaderBeforeStoringTheBody) {
  FrameAssembler assembler;
  XpcBytes header = Body().u32(kMaxFrameBodyBytes + 1).u8(0x0A).bytes();
  EXPECT_FALSE(assembler.consume(header).ok());

  FrameAssembler announced;
  XpcBytes partial = Body().u32(kMaxFrameBodyBytes).dict(0).bytes();
  ASSERT_EQ(*announced.consume(partial), partial.size());
  EXPECT_EQ(announced.bufferedBytes(), partial.size());
  EXPECT_TRUE(announced.midFrame());
}

}  // namespace
}  // namespace vtr
