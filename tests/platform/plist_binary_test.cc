// The binary property-list writer: the exact encoding of each kind, round
// trips that keep every value and its kind, objects shared when repeated, and
// the streaming dictionary writer's order, replacement, failures and memory.
#include <gtest/gtest.h>
#include <malloc.h>

#include <algorithm>
#include <cstdint>
#include <limits>
#include <string>
#include <vector>

#include "platform/format.h"
#include "platform/output_stream.h"
#include "platform/plist.h"
#include "tests/platform/strict_value.h"

#if defined(__has_feature)
#if __has_feature(address_sanitizer)
#define VTR_ASAN 1
#endif
#endif
#if defined(__SANITIZE_ADDRESS__)
#define VTR_ASAN 1
#endif
#ifdef VTR_ASAN
#include <sanitizer/allocator_interface.h>
#endif

namespace vtr {
namespace {

using testing::StrictlyEqual;

std::string Hex(std::span<const uint8_t> bytes) {
  static const char kDigits[] = "0123456789abcdef";
  std::string text;
  for (uint8_t b : bytes) {
    text += kDigits[b >> 4];
    text += kDigits[b & 15];
  }
  return text;
}

Bytes Encode(const Value& value) {
  Result<Bytes> bytes = EncodeBinaryPropertyList(value);
  EXPECT_TRUE(bytes.ok()) << bytes.error().message();
  return bytes.ok() ? *bytes : Bytes{};
}

uint64_t BigEndian(const uint8_t* p, size_t size) {
  uint64_t v = 0;
  for (size_t i = 0; i < size; ++i) v = v << 8 | p[i];
  return v;
}

// The trailer of a file, decoded here independently of the reader.
struct TrailerFields {
  uint8_t offsetSize, refSize;
  uint64_t objects, top, tableOffset;
};
TrailerFields TrailerOf(const Bytes& file) {
  const uint8_t* t = file.data() + file.size() - 32;
  return {t[6], t[7], BigEndian(t + 8, 8), BigEndian(t + 16, 8), BigEndian(t + 24, 8)};
}

// The objects of a file holding a single scalar: what lies between the magic
// and the offset table.
std::string ScalarObjectHex(const Value& value) {
  const Bytes file = Encode(value);
  if (file.size() < 40) return "";
  return Hex(std::span(file).subspan(8, TrailerOf(file).tableOffset - 8));
}

TEST(BinaryPlistWriterTest, ScalarsTakeTheirSmallestExactEncoding) {
  const std::string fifteen(15, 'a');
  const struct {
    Value value;
    std::string hex;
  } cases[] = {
      {Value::Integer(0), "1000"},
      {Value::Integer(255), "10ff"},
      {Value::Integer(256), "110100"},
      {Value::Integer(65535), "11ffff"},
      {Value::Integer(65536), "1200010000"},
      {Value::Integer(4294967295), "12ffffffff"},
      {Value::Integer(4294967296), "130000000100000000"},
      {Value::Integer(-1), "13ffffffffffffffff"},
      {Value::Integer(std::numeric_limits<int64_t>::min()), "138000000000000000"},
      // Unsigned values always take 16 bytes so that they read back unsigned.
      {Value::Unsigned(5), "1400000000000000000000000000000005"},
      {Value::Real(1.5), "233ff8000000000000"},
      {Value::DateValue(Date{-1.0}), "33bff0000000000000"},
      {Value::Boolean(true), "09"},
      {Value::Boolean(false), "08"},
      {Value::String(""), "50"},
      {Value::String("abc"), "53616263"},
      {Value::String(fifteen), "5f100f" + Hex(Bytes(15, 'a'))},  // a count that needs its own integer
      {Value::String("\xC3\xA9"), "6100e9"},                     // é
      {Value::String("\xF0\x9F\x98\x80"), "62d83dde00"},         // U+1F600, a surrogate pair
      {Value::String(std::string("a\0b", 3)), "53610062"},
      {Value::Data(Bytes{}), "40"},
      {Value::Data(Bytes{1, 2}), "420102"},
  };
  for (const auto& c : cases) EXPECT_EQ(ScalarObjectHex(c.value), c.hex) << c.value.description();
}

TEST(BinaryPlistWriterTest, TrailerSizesFitTheObjectCountAndFileSize) {
  const Bytes small = Encode(Value::ArrayOf({Value::Integer(7), Value::String("x")}));
  TrailerFields t = TrailerOf(small);
  EXPECT_EQ(t.offsetSize, 1);
  EXPECT_EQ(t.refSize, 1);
  EXPECT_EQ(t.objects, 3u);
  EXPECT_LT(t.top, t.objects);
  EXPECT_EQ(t.tableOffset + t.objects * t.offsetSize + 32, small.size());
  // 300 distinct objects need 2-byte references and offsets.
  Array many;
  for (int i = 0; i < 300; ++i) many.push_back(Value::Integer(1000 + i));
  const Bytes large = Encode(Value::ArrayOf(many));
  t = TrailerOf(large);
  EXPECT_EQ(t.refSize, 2);
  EXPECT_EQ(t.offsetSize, 2);
  EXPECT_EQ(t.objects, 301u);
}

TEST(BinaryPlistWriterTest, RoundTripKeepsEveryValueAndItsKind) {
  Array wideArray;
  DictionaryBuilder wideDict;
  for (int i = 0; i < 40; ++i) {
    wideArray.push_back(Value::Integer(i - 20));
    wideDict.add(Format("k%d", i), Value::Real(i / 4.0));
  }
  const Value values[] = {
      Value::Integer(-1),
      Value::Integer(std::numeric_limits<int64_t>::min()),
      Value::Integer(std::numeric_limits<int64_t>::max()),
      Value::Integer(4294967296),
      Value::Unsigned(0),
      Value::Unsigned(uint64_t{1} << 63),
      Value::Unsigned(UINT64_MAX),
      Value::Real(-0.0),
      Value::Real(1e-310),
      Value::Real(std::numeric_limits<double>::infinity()),
      Value::DateValue(Date::FromUnix(-2208988800)),            // 1900
      Value::DateValue(Date::FromUnix(4107585600, 250000000)),  // 2100, with a fraction
      Value::String("Gr\u00FC\u00DFe \u65E5\u672C \U0001F389"),
      Value::String(std::string("nul\0inside", 10)),
      Value::Data(Bytes{}),
      Value::Data(Bytes(1000, 0xAB)),
      Value::ArrayOf({}),
      Value::DictionaryOf(Dictionary()),
      Value::ArrayOf(wideArray),
      wideDict.build(),
      Value::DictionaryOf({
          {"\xD0\xBA\xD0\xBB\xD1\x8E\xD1\x87", Value::ArrayOf({Value::Boolean(true), Value::Boolean(false)})},
          {"nested", Value::DictionaryOf({{"deeper", Value::ArrayOf({Value::Unsigned(3), Value::Integer(3)})}})},
      }),
  };
  for (const Value& value : values) {
    const Bytes bytes = Encode(value);
    Result<Value> back = ReadBinaryPropertyList(bytes);
    ASSERT_TRUE(back.ok()) << value.description() << ": " << back.error().message();
    EXPECT_TRUE(StrictlyEqual(*back, value));
    EXPECT_EQ(Encode(*back), bytes) << "output differs for an equal value: " << value.description();
  }
}

size_t Occurrences(const Bytes& haystack, std::string_view needle) {
  size_t count = 0;
  for (auto it = haystack.begin();
       (it = std::search(it, haystack.end(), needle.begin(), needle.end())) != haystack.end(); ++it) {
    ++count;
  }
  return count;
}

TEST(BinaryPlistWriterTest, RepeatedObjectsAreWrittenOnceAndStillReadCorrectly) {
  // More distinct small objects than the writer remembers, so that the
  // memory of written objects turns over many times while some keys recur.
  Array records;
  for (int i = 0; i < 10000; ++i) {
    records.push_back(Value::DictionaryOf({
        {"NSFileOwnerAccountName", Value::String("mobile")},
        {"number", Value::Integer(i % 3000)},
        {"text", Value::String(Format("v%d", i % 2500))},
    }));
  }
  const Value value = Value::ArrayOf(records);
  const Bytes bytes = Encode(value);
  EXPECT_EQ(Occurrences(bytes, "NSFileOwnerAccountName"), 1u);
  EXPECT_EQ(Occurrences(bytes, "mobile"), 1u);
  Result<Value> back = ReadBinaryPropertyList(bytes);
  ASSERT_TRUE(back.ok()) << back.error().message();
  EXPECT_TRUE(StrictlyEqual(*back, value));
}

TEST(BinaryPlistWriterTest, RefusesNilAndStringsThatAreNotUtf8) {
  const std::string badText[] = {"\xFF", "\xC0\x80", "\xED\xA0\x80", "\xE2\x82", "\xF4\x90\x80\x80", "ok\x80"};
  std::vector<Value> bad = {Value(), Value::ArrayOf({Value::Integer(1), Value()}),
                            Value::DictionaryOf({{"k", Value()}})};
  for (const std::string& text : badText) {
    bad.push_back(Value::String(text));
    bad.push_back(Value::DictionaryOf({{text, Value::Integer(1)}}));
  }
  for (const Value& value : bad) {
    Result<Bytes> bytes = EncodeBinaryPropertyList(value);
    EXPECT_FALSE(bytes.ok()) << Hex(bytes.ok() ? *bytes : Bytes{});
  }
  Result<Bytes> nil = EncodeBinaryPropertyList(Value::ArrayOf({Value()}));
  ASSERT_FALSE(nil.ok());
  EXPECT_EQ(nil.error().message(), "binary property list: a nil value cannot be written");
}

TEST(BinaryPlistWriterTest, WritesAndReadsNestingOfAnyDepthWithoutRecursion) {
  constexpr int kDepth = 5000;
  Value value = Value::String("bottom");
  for (int i = 0; i < kDepth; ++i) value = Value::ArrayOf({value});
  const Bytes bytes = Encode(value);
  PlistLimits limits;
  limits.maxDepth = kDepth;
  Result<Value> back = ReadBinaryPropertyList(bytes, limits);
  ASSERT_TRUE(back.ok()) << back.error().message();
  EXPECT_TRUE(*back == value);
  limits.maxDepth = kDepth - 1;
  EXPECT_FALSE(ReadBinaryPropertyList(bytes, limits).ok());
}

// ---- The streaming dictionary writer ---------------------------------------

// A record shaped like a manifest entry.
Value Record(int i) {
  return Value::DictionaryOf({
      {"VTRManifestFileAttributes", Value::DictionaryOf({
                                        {"NSFileOwnerAccountName", Value::String("mobile")},
                                        {"NSFilePosixPermissions", Value::Integer(0644)},
                                        {"NSFileSize", Value::Unsigned(1000 + i)},
                                        {"NSFileModificationDate", Value::DateValue(Date{1e8 + i})},
                                    })},
      {"VTRManifestFileExtendedAttributes", Value::DictionaryOf(Dictionary())},
      {"VTRManifestFileHash", Value::Data(Bytes(20, static_cast<uint8_t>(i)))},
  });
}

std::string Path(int i) { return "/private/var/mobile/file-" + std::to_string(i); }

Bytes Stream(const std::vector<std::pair<std::string, Value>>& adds) {
  MemoryOutputStream out;
  BinaryPlistDictionaryWriter writer(&out);
  for (const auto& [key, value] : adds) EXPECT_TRUE(writer.add(key, value).ok()) << key;
  EXPECT_TRUE(writer.finish().ok());
  return out.take();
}

// The keys of the top dictionary in the order the file stores them.
std::vector<std::string> TopKeysInFileOrder(const Bytes& file) {
  const TrailerFields t = TrailerOf(file);
  auto offsetOf = [&](uint64_t index) { return BigEndian(&file[t.tableOffset + index * t.offsetSize], t.offsetSize); };
  const uint8_t* top = &file[offsetOf(t.top)];
  uint64_t count = top[0] & 0x0F;
  const uint8_t* refs = top + 1;
  if (count == 0x0F) {
    const size_t size = size_t{1} << (top[1] & 0x0F);
    count = BigEndian(top + 2, size);
    refs = top + 2 + size;
  }
  std::vector<std::string> keys;
  for (uint64_t i = 0; i < count; ++i) {
    const uint8_t* key = &file[offsetOf(BigEndian(refs + i * t.refSize, t.refSize))];
    keys.emplace_back(reinterpret_cast<const char*>(key + 1), key[0] & 0x0F);  // short ASCII keys
  }
  return keys;
}

TEST(BinaryPlistDictionaryWriterTest, EntriesKeepTheirAddOrderAndReadBack) {
  const Bytes bytes = Stream({{"zeta", Record(1)}, {"alpha", Value::Integer(2)}, {"mid", Record(3)}});
  EXPECT_EQ(TopKeysInFileOrder(bytes), (std::vector<std::string>{"zeta", "alpha", "mid"}));
  Result<Value> back = ReadBinaryPropertyList(bytes);
  ASSERT_TRUE(back.ok()) << back.error().message();
  EXPECT_TRUE(StrictlyEqual(
      *back, Value::DictionaryOf({{"zeta", Record(1)}, {"alpha", Value::Integer(2)}, {"mid", Record(3)}})));
}

TEST(BinaryPlistDictionaryWriterTest, SameAddsGiveSameBytesAndAnEmptyWriterGivesAnEmptyDictionary) {
  std::vector<std::pair<std::string, Value>> adds;
  for (int i = 0; i < 500; ++i) adds.emplace_back(Path(i), Record(i));
  EXPECT_EQ(Stream(adds), Stream(adds));
  Result<Value> empty = ReadBinaryPropertyList(Stream({}));
  ASSERT_TRUE(empty.ok()) << empty.error().message();
  EXPECT_TRUE(StrictlyEqual(*empty, Value::DictionaryOf(Dictionary())));
}

TEST(BinaryPlistDictionaryWriterTest, AddingAKeyAgainReplacesItsValueInPlace) {
  // Enough keys to make the writer's key index grow several times.
  constexpr int kKeys = 3000;
  std::vector<std::pair<std::string, Value>> adds;
  DictionaryBuilder expected;
  for (int i = 0; i < kKeys; ++i) adds.emplace_back(Path(i), Value::Integer(i));
  for (int i = 0; i < kKeys; i += 7) adds.emplace_back(Path(i), Value::String("replaced " + std::to_string(i)));
  for (int i = 0; i < kKeys; ++i) {
    expected.add(Path(i), i % 7 == 0 ? Value::String("replaced " + std::to_string(i)) : Value::Integer(i));
  }
  const Bytes bytes = Stream(adds);
  Result<Value> back = ReadBinaryPropertyList(bytes);
  ASSERT_TRUE(back.ok()) << back.error().message();
  EXPECT_TRUE(StrictlyEqual(*back, expected.build()));
  // A replaced key keeps its first place.
  const Bytes small = Stream({{"b", Value::Integer(1)}, {"a", Value::Integer(2)}, {"b", Value::Integer(3)}});
  EXPECT_EQ(TopKeysInFileOrder(small), (std::vector<std::string>{"b", "a"}));
}

TEST(BinaryPlistDictionaryWriterTest, RefusedEntriesLeaveAUsableWriterAndFinishIsFinal) {
  MemoryOutputStream out;
  BinaryPlistDictionaryWriter writer(&out);
  EXPECT_FALSE(writer.add("nil", Value()).ok());
  EXPECT_FALSE(writer.add("nested nil", Value::ArrayOf({Value::Integer(1), Value()})).ok());
  EXPECT_FALSE(writer.add("bad key \xFF", Value::Integer(1)).ok());
  ASSERT_TRUE(writer.add("good", Value::Integer(1)).ok());
  ASSERT_TRUE(writer.finish().ok());
  EXPECT_FALSE(writer.add("late", Value::Integer(2)).ok());
  EXPECT_FALSE(writer.finish().ok());
  Result<Value> back = ReadBinaryPropertyList(out.bytes());
  ASSERT_TRUE(back.ok()) << back.error().message();
  EXPECT_TRUE(StrictlyEqual(*back, Value::DictionaryOf({{"good", Value::Integer(1)}})));
}

// Accepts a given number of bytes, then fails every write; or, with no
// limit, counts and discards everything.
class LimitedStream final : public OutputStream {
 public:
  explicit LimitedStream(uint64_t limit = UINT64_MAX) : limit_(limit) {}
  Status write(const void*, size_t length) override {
    if (length > limit_ - position_) return Error(ENOSPC, "limited stream");
    position_ += length;
    return Status::Ok();
  }
  uint64_t position() const override { return position_; }
  Status flush() override { return Status::Ok(); }

 private:
  uint64_t limit_;
  uint64_t position_ = 0;
};

TEST(BinaryPlistDictionaryWriterTest, StreamFailuresAreReported) {
  for (uint64_t limit : {0, 8, 100, 5000}) {
    LimitedStream out(limit);
    BinaryPlistDictionaryWriter writer(&out);
    Status status;
    int added = 0;
    for (; added < 100 && status.ok(); ++added) status = writer.add(Path(added), Record(added));
    ASSERT_FALSE(status.ok()) << "limit " << limit;
    EXPECT_EQ(status.error().code(), ENOSPC);
    // Objects the writer has already written, and would only refer to, are
    // refused too: the file cannot be completed.
    if (added > 1) {
      EXPECT_FALSE(writer.add(Path(0), Record(0)).ok());
    }
    EXPECT_FALSE(writer.finish().ok());
  }
}

// Bytes of heap in use, by whichever allocator is in charge.
size_t HeapInUse() {
#ifdef VTR_ASAN
  return __sanitizer_get_current_allocated_bytes();
#else
  const struct mallinfo2 info = mallinfo2();
  return info.uordblks + info.hblkhd;
#endif
}

TEST(BinaryPlistDictionaryWriterTest, MemoryGrowsOnlyByASmallIndexPerEntry) {
  LimitedStream out;
  BinaryPlistDictionaryWriter writer(&out);
  auto addUpTo = [&](int from, int to) {
    for (int i = from; i < to; ++i) ASSERT_TRUE(writer.add(Path(i), Record(i)).ok());
  };
  addUpTo(0, 5000);
  const size_t before = HeapInUse();
  addUpTo(5000, 35000);
  const size_t after = HeapInUse();
  const double perEntry = (static_cast<double>(after) - static_cast<double>(before)) / 30000;
  EXPECT_LT(perEntry, 100) << "the writer keeps what it has written";
  ASSERT_TRUE(writer.finish().ok());
}

}  // namespace
}  // namespace vtr
