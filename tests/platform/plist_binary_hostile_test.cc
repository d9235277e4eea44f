// The binary property-list reader against truncated, corrupt and hostile
// input: each must fail with an error that says what is wrong and where,
// quickly and without a crash, whatever the file claims about itself.
#include <gtest/gtest.h>

#include <cstdint>
#include <string>
#include <vector>

#include "platform/plist.h"
#include "platform/plist_document.h"
#include "tests/platform/strict_value.h"

namespace vtr {
namespace {

using testing::StrictlyEqual;

void AppendBigEndian(Bytes* out, uint64_t v, size_t size) {
  for (size_t i = size; i > 0; --i) out->push_back(static_cast<uint8_t>(v >> (8 * (i - 1))));
}

// A file made of the given object encodings (object i is objects[i]), with a
// correct offset table and trailer: the test chooses every byte of the
// objects, including their references (refSize bytes each).
Bytes Assemble(const std::vector<Bytes>& objects, uint64_t top = 0, uint8_t refSize = 1) {
  Bytes file = {'b', 'p', 'l', 'i', 's', 't', '0', '0'};
  std::vector<uint64_t> offsets;
  for (const Bytes& object : objects) {
    offsets.push_back(file.size());
    file.insert(file.end(), object.begin(), object.end());
  }
  const uint64_t tableOffset = file.size();
  const uint8_t offsetSize = tableOffset <= 0xFF ? 1 : tableOffset <= 0xFFFF ? 2 : 4;
  for (uint64_t offset : offsets) AppendBigEndian(&file, offset, offsetSize);
  file.insert(file.end(), 6, 0);
  file.push_back(offsetSize);
  file.push_back(refSize);
  AppendBigEndian(&file, objects.size(), 8);
  AppendBigEndian(&file, top, 8);
  AppendBigEndian(&file, tableOffset, 8);
  return file;
}

// Trailer fields, by their distance from the end of the file.
constexpr size_t kOffsetSizeAt = 26, kRefSizeAt = 25, kObjectCountAt = 24, kTopAt = 16, kTableOffsetAt = 8;

Bytes Patched(Bytes file, size_t fromEnd, uint64_t value, size_t size) {
  Bytes field;
  AppendBigEndian(&field, value, size);
  std::copy(field.begin(), field.end(), file.end() - static_cast<ptrdiff_t>(fromEnd));
  return file;
}

Bytes Text(std::string_view text) { return Bytes(text.begin(), text.end()); }

std::string ErrorOf(const Bytes& file, const PlistLimits& limits = {}) {
  Result<Value> result = ReadBinaryPropertyList(file, limits);
  if (result.ok()) return "accepted as " + result->description();
  return result.error().message();
}

TEST(BinaryPlistHostileTest, MalformedFilesFailWithWhatAndWhere) {
  const Bytes one = Assemble({{0x09}});  // true
  Bytes badMagic = one;
  badMagic[7] = '1';
  const std::string p = "binary property list: ";
  const struct {
    Bytes file;
    std::string error;
  } cases[] = {
      {badMagic, p + "bad magic"},
      {Text("bplist00 too short for a trailer"), p + "input too short"},
      {Patched(one, kOffsetSizeAt, 3, 1), p + "bad offset size 3"},
      {Patched(one, kRefSizeAt, 0, 1), p + "bad reference size 0"},
      {Patched(one, kObjectCountAt, 0, 8), p + "no objects"},
      {Patched(one, kTopAt, 1, 8), p + "top object out of range"},
      {Patched(one, kTableOffsetAt, UINT64_MAX, 8), p + "offset table outside the file"},
      {Patched(one, kTableOffsetAt, 3, 8), p + "offset table outside the file"},
      {Patched(one, kObjectCountAt, uint64_t{1} << 62, 8), p + "offset table outside the file"},
      // Offsets: into the magic, into the offset table (object 1 is never
      // referenced, yet checked).
      {Patched(Assemble({{0x09}}), 33, 2, 1), p + "object 0: offset outside the object area"},
      {Patched(Assemble({{0x09}, {0x08}}), 33, 10, 1), p + "object 1: offset outside the object area"},
      // Markers and sizes.
      {Assemble({{0xA1, 0x05}, {0x09}}), p + "object 0 at offset 8: reference 5 out of range"},
      {Assemble({{0x5F, 0x10, 0xFF, 'a', 'b'}}), p + "object 0 at offset 8: count 255 runs past the object area"},
      {Assemble({{0xAF, 0x13, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF}}),
       p + "object 0 at offset 8: count 18446744073709551615 runs past the object area"},
      {Assemble({{0x5F, 0x22, 0x00}}), p + "object 0 at offset 8: bad extended count"},
      {Assemble({{0x5F, 0x14, 0x00}}), p + "object 0 at offset 8: bad extended count"},
      {Assemble({{0x5F, 0x11, 0x00}}), p + "object 0 at offset 8: count runs past the object area"},
      {Assemble({{0x13, 0x00, 0x01}}), p + "object 0 at offset 8: object runs past the object area"},
      {Assemble({{0x15, 0x00}}), p + "object 0 at offset 8: bad integer size"},
      {Assemble({{0x21, 0x00, 0x00}}), p + "object 0 at offset 8: bad real size"},
      {Assemble({{0x32, 0x00, 0x00, 0x00, 0x00}}), p + "object 0 at offset 8: bad date size"},
      {Assemble({{0x80, 0x01}}), p + "object 0 at offset 8: UID objects are not supported"},
      {Assemble({{0x0F}}), p + "object 0 at offset 8: unknown marker"},
      {Assemble({{0x70}}), p + "object 0 at offset 8: unknown marker"},
      {Assemble({{0xB0}}), p + "object 0 at offset 8: unknown marker"},
      {Assemble({{0xC0}}), p + "object 0 at offset 8: unknown marker"},
      {Assemble({{0xF0}}), p + "object 0 at offset 8: unknown marker"},
      // Contents.
      {Assemble({{0x51, 0xE9}}), p + "object 0 at offset 8: non-ASCII byte in an ASCII string"},
      {Assemble({{0x61, 0xD8, 0x00}}), p + "object 0 at offset 8: invalid UTF-16 string"},
      {Assemble({{0x61, 0xDC, 0x00}}), p + "object 0 at offset 8: invalid UTF-16 string"},
      {Assemble({{0x62, 0xD8, 0x00, 0x00, 0x41}}), p + "object 0 at offset 8: invalid UTF-16 string"},
      {Assemble({{0x14, 0, 0, 0, 0, 0, 0, 0, 1, 0, 0, 0, 0, 0, 0, 0, 0}}),
       p + "object 0 at offset 8: integer does not fit in 64 bits"},
      {Assemble({{0x14, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0, 0, 0, 0, 0, 0, 0, 1}}),
       p + "object 0 at offset 8: integer does not fit in 64 bits"},
      // Structure.
      {Assemble({{0xD1, 0x01, 0x02}, {0x10, 0x01}, {0x10, 0x02}}), p + "object 1: dictionary key is not a string"},
      {Assemble({{0xD2, 0x01, 0x01, 0x02, 0x03}, {0x51, 'k'}, {0x10, 0x01}, {0x10, 0x02}}),
       p + "object 0 at offset 8: duplicate dictionary key"},
      {Assemble({{0xA1, 0x00}}), p + "object 0: contains itself"},
      {Assemble({{0xA1, 0x01}, {0xD1, 0x02, 0x00}, {0x51, 'k'}}), p + "object 0: contains itself"},
  };
  for (const auto& c : cases) EXPECT_EQ(ErrorOf(c.file), c.error);
}

// The document reader checks all of a file when it opens it, so that what
// it hands out later cannot fail: it refuses deep inside what the whole-file
// reader refuses, and reads the same value from what that reader accepts.
TEST(BinaryPlistHostileTest, TheDocumentReaderRefusesWhatTheReaderRefuses) {
  // {"a": object 2}, with object 2 varied; 3 is "k", 4 the integer 1.
  const auto file = [](Bytes inner, std::vector<Bytes> more = {}) {
    std::vector<Bytes> objects = {{0xD1, 1, 2}, {0x51, 'a'}, std::move(inner), {0x51, 'k'}, {0x10, 1}};
    for (Bytes& object : more) objects.push_back(std::move(object));
    return Assemble(objects);
  };
  const struct {
    const char* name;
    Bytes file;
    bool accepted;
  } cases[] = {
      {"two keys", file({0xD2, 3, 5, 4, 4}, {{0x51, 'j'}}), true},
      {"a UTF-16 key", file({0xD2, 3, 5, 4, 4}, {{0x61, 0, 'j'}}), true},
      {"one key object twice", file({0xD2, 3, 3, 4, 4}), false},
      {"the same text in ASCII and UTF-16", file({0xD2, 3, 5, 4, 4}, {{0x61, 0, 'k'}}), false},
      {"a number as key", file({0xD1, 4, 4}), false},
      {"an array holding itself", file({0xA1, 2}), false},
      {"a byte past ASCII", file({0xD1, 3, 5}, {{0x51, 0xC3}}), false},
      {"an unpaired surrogate", file({0xD1, 3, 5}, {{0x61, 0xD8, 0x00}}), false},
  };
  for (const auto& c : cases) {
    Result<Value> whole = ReadBinaryPropertyList(c.file);
    Result<std::unique_ptr<PlistDocument>> document = PlistDocument::Open(c.file);
    EXPECT_EQ(whole.ok(), c.accepted) << c.name;
    ASSERT_EQ(document.ok(), c.accepted) << c.name << ": " << (document.ok() ? "" : document.error().message());
    if (!c.accepted) continue;
    const PlistNode top = (*document)->top();
    EXPECT_TRUE(StrictlyEqual(*top.value(), *whole)) << c.name;
    ASSERT_EQ(top.count(), 1u);
    EXPECT_EQ(top.keyAt(0), "a");
    EXPECT_EQ(top.get("a").count(), 2u);
    EXPECT_TRUE(StrictlyEqual(*top.get("a").get("k").value(), Value::Integer(1))) << c.name;
    EXPECT_TRUE(top.get("b").isNil());
  }
}

// A document hands out what it holds without building the rest: data in
// place, and in either format the same entries in the same order.
TEST(BinaryPlistHostileTest, DocumentNodesInEitherFormat) {
  const Value value = Value::DictionaryOf({{"z", Value::Data({1, 2, 3})},
                                           {"a", Value::ArrayOf({Value::String("x"), Value::Integer(-1)})},
                                           {"m", Value::DictionaryOf({{"caf\u00e9", Value::Boolean(true)}})}});
  const std::string xml = *EncodeXmlPropertyList(value);
  const Bytes binary = *EncodeBinaryPropertyList(value);
  const Bytes text(xml.begin(), xml.end());
  for (const Bytes* bytes : {&binary, &text}) {
    Result<std::unique_ptr<PlistDocument>> document = PlistDocument::Open(*bytes);
    ASSERT_TRUE(document.ok()) << document.error().message();
    const PlistNode top = (*document)->top();
    EXPECT_TRUE(StrictlyEqual(*top.value(), value));
    std::vector<std::string> keys;
    top.forEachEntry([&](const std::string& key, const PlistNode&) {
      keys.push_back(key);
      return key != "m";
    });
    EXPECT_EQ(keys, (std::vector<std::string>{"a", "m"}));
    const std::optional<std::span<const uint8_t>> data = top.get("z").data();
    ASSERT_TRUE(data.has_value());
    EXPECT_EQ(Bytes(data->begin(), data->end()), (Bytes{1, 2, 3}));
    if (bytes == &binary) {
      EXPECT_TRUE(data->data() > binary.data() && data->data() < binary.data() + binary.size());
    }
    EXPECT_EQ(top.get("a").type(), Value::Type::kArray);
    EXPECT_EQ(top.get("a").count(), 2u);
    EXPECT_TRUE(StrictlyEqual(*top.get("m").get("caf\u00e9").value(), Value::Boolean(true)));
    EXPECT_FALSE(top.get("a").data().has_value());
  }
}

TEST(BinaryPlistHostileTest, OddButValidEncodingsAreRead) {
  Bytes quirks = Assemble({{0x09}});
  quirks[quirks.size() - 32] = 0x55;  // unused trailer bytes and sort version are ignored
  quirks[quirks.size() - 27] = 0x01;
  const struct {
    Bytes file;
    Value value;
  } cases[] = {
      {Assemble({{0x63, 0x00, 0x41, 0x00, 0x00, 0x00, 0x42}}), Value::String(std::string("A\0B", 3))},
      {Assemble({{0x62, 0xD8, 0x3D, 0xDE, 0x00}}), Value::String("\xF0\x9F\x98\x80")},
      {Assemble({{0x00}}), Value()},
      {Assemble({{0x10, 0xFF}}), Value::Integer(255)},
      {Assemble({{0x12, 0xFF, 0xFF, 0xFF, 0xFF}}), Value::Integer(4294967295)},
      {Assemble({{0x13, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF}}), Value::Integer(-1)},
      {Assemble(
           {{0x14, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFE}}),
       Value::Integer(-2)},
      {Assemble({{0x14, 0, 0, 0, 0, 0, 0, 0, 0, 0x80, 0, 0, 0, 0, 0, 0, 0}}), Value::Unsigned(uint64_t{1} << 63)},
      {Assemble({{0x22, 0x3F, 0xC0, 0x00, 0x00}}), Value::Real(1.5)},
      {Assemble({{0x5F, 0x10, 0x02, 'h', 'i'}}), Value::String("hi")},  // a needlessly extended count
      {Assemble({{0xA3, 0x01, 0x01, 0x01}, {0x51, 's'}}),
       Value::ArrayOf({Value::String("s"), Value::String("s"), Value::String("s")})},
      {quirks, Value::Boolean(true)},
  };
  for (const auto& c : cases) {
    Result<Value> value = ReadBinaryPropertyList(c.file);
    ASSERT_TRUE(value.ok()) << value.error().message();
    EXPECT_TRUE(StrictlyEqual(*value, c.value));
  }
}

// A file worth corrupting: nested containers, shared objects, extended
// counts, UTF-16 and every scalar kind.
Bytes SampleFile() {
  Array items;
  for (int i = 0; i < 16; ++i) items.push_back(Value::Integer(i * 1000));
  Result<Bytes> bytes = EncodeBinaryPropertyList(Value::DictionaryOf({
      {"items", Value::ArrayOf(items)},
      {"text", Value::String("caf\xC3\xA9 and more text")},
      {"same", Value::ArrayOf({Value::String("shared"), Value::String("shared")})},
      {"when", Value::DateValue(Date{-5e8})},
      {"data", Value::Data(Bytes(20, 7))},
      {"flags", Value::DictionaryOf({{"on", Value::Boolean(true)}, {"big", Value::Unsigned(UINT64_MAX)}})},
      {"real", Value::Real(0.25)},
  }));
  EXPECT_TRUE(bytes.ok());
  return bytes.ok() ? *bytes : Bytes{};
}

TEST(BinaryPlistHostileTest, EveryTruncationFails) {
  const Bytes file = SampleFile();
  ASSERT_TRUE(ReadBinaryPropertyList(file).ok());
  for (size_t length = 0; length < file.size(); ++length) {
    EXPECT_FALSE(ReadBinaryPropertyList(std::span(file).first(length)).ok()) << "cut at " << length;
  }
}

TEST(BinaryPlistHostileTest, EveryCorruptedByteFailsOrReadsAValueThatSurvivesARoundTrip) {
  const Bytes file = SampleFile();
  size_t failures = 0;
  for (size_t at = 0; at < file.size(); ++at) {
    for (uint8_t change : {0x01, 0x80, 0xFF}) {
      Bytes corrupt = file;
      corrupt[at] ^= change;
      Result<Value> value = ReadBinaryPropertyList(corrupt);
      if (!value.ok()) {
        ++failures;
        continue;
      }
      EXPECT_GE(at, 8u) << "a corrupt magic was accepted";
      Result<Bytes> again = EncodeBinaryPropertyList(*value);
      if (!again.ok()) continue;  // e.g. a byte turned into a null object
      Result<Value> reread = ReadBinaryPropertyList(*again);
      ASSERT_TRUE(reread.ok()) << reread.error().message();
      EXPECT_TRUE(StrictlyEqual(*reread, *value)) << "byte " << at;
    }
  }
  EXPECT_GT(failures, file.size());
}

// Levels of arrays that each refer twice to the level below, over one
// string: a file of a few bytes per level that expands to 2^levels strings.
Bytes SharedReferenceBomb(int levels) {
  std::vector<Bytes> objects = {{0x51, 'x'}};
  for (int i = 1; i <= levels; ++i) {
    objects.push_back({0xA2, static_cast<uint8_t>(i - 1), static_cast<uint8_t>(i - 1)});
  }
  return Assemble(objects, levels);
}

TEST(BinaryPlistHostileTest, SharedReferencesCountEveryTimeTheyAreReached) {
  // 163 bytes describing 2^31 objects: refused once a million are reached.
  const Bytes bomb = SharedReferenceBomb(30);
  EXPECT_EQ(bomb.size(), 163u);
  EXPECT_EQ(ErrorOf(bomb), "binary property list: object 18: expanded result exceeds 1048576 objects");

  // A small expansion is read whole, shared parts and all.
  Result<Value> small = ReadBinaryPropertyList(SharedReferenceBomb(3));
  ASSERT_TRUE(small.ok()) << small.error().message();
  const Value x = Value::String("x");
  const Value two = Value::ArrayOf({x, x});
  const Value four = Value::ArrayOf({two, two});
  EXPECT_TRUE(StrictlyEqual(*small, Value::ArrayOf({four, four})));

  // Bytes count each time too: a 100-byte string referenced 100 times.
  std::vector<Bytes> objects = {{0xA0 | 0x0F, 0x10, 100}};
  objects[0].insert(objects[0].end(), 100, 0x01);
  Bytes text = {0x5F, 0x10, 100};
  text.insert(text.end(), 100, 'a');
  objects.push_back(text);
  const Bytes spread = Assemble(objects);
  PlistLimits limits;
  limits.maxExpandedBytes = 9999;
  EXPECT_EQ(ErrorOf(spread, limits), "binary property list: object 1: expanded result exceeds 9999 bytes");
  limits.maxExpandedBytes = 10000;
  EXPECT_TRUE(ReadBinaryPropertyList(spread, limits).ok());
  limits = {};
  limits.maxExpandedNodes = 100;
  EXPECT_EQ(ErrorOf(spread, limits), "binary property list: object 1: expanded result exceeds 100 objects");
  limits.maxExpandedNodes = 101;
  EXPECT_TRUE(ReadBinaryPropertyList(spread, limits).ok());
}

// levels arrays, each holding the next; the innermost holds the outermost.
Bytes NestedArrays(uint32_t levels) {
  std::vector<Bytes> objects;
  for (uint32_t i = 0; i < levels; ++i) {
    Bytes array = {0xA1};
    AppendBigEndian(&array, (i + 1) % levels, 4);
    objects.push_back(array);
  }
  return Assemble(objects, 0, 4);
}

TEST(BinaryPlistHostileTest, DeepNestingIsBoundedAndNeverRecurses) {
  const Bytes deep = NestedArrays(100000);
  EXPECT_EQ(ErrorOf(deep), "binary property list: object 512 at offset 2568: nested deeper than 512 levels");
  // With the depth limit lifted the reader walks all the way down on its own
  // stack and finds the cycle at the bottom.
  PlistLimits limits;
  limits.maxDepth = 1000000;
  EXPECT_EQ(ErrorOf(deep, limits), "binary property list: object 0: contains itself");
}

TEST(BinaryPlistHostileTest, InputLargerThanTheLimitIsRefused) {
  const Bytes file = SampleFile();
  PlistLimits limits;
  limits.maxInputBytes = file.size() - 1;
  EXPECT_EQ(ErrorOf(file, limits), "binary property list: input of " + std::to_string(file.size()) +
                                       " bytes exceeds the limit of " + std::to_string(file.size() - 1) + " bytes");
  limits.maxInputBytes = file.size();
  EXPECT_TRUE(ReadBinaryPropertyList(file, limits).ok());
}

}  // namespace
}  // namespace vtr
