// Property lists through both codecs and through files: a value survives
// XML -> value -> binary -> value unchanged, Python's plistlib (an independent
// reader and writer) agrees with what we write and read, and the file
// functions refuse what is not a regular file within bounds.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <cmath>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <limits>
#include <optional>
#include <string>
#include <vector>

#include "platform/plist.h"
#include "tests/support/test_support.h"

namespace vtr {
namespace {

// A value with every kind and the awkward corners of each: negative and
// unsigned integers past INT64_MAX, reals that print oddly (negative zero,
// whole, subnormal, infinite), dates before 2001 and after 2038,
// non-ASCII text, empty data, and containers of more than 14 entries (the
// size where the binary format changes how a count is written).
Value SampleValue() {
  Array many;
  for (int i = 0; i < 40; ++i) many.push_back(Value::Integer(i * 1000 - 7));
  DictionaryBuilder wide;
  for (int i = 0; i < 20; ++i) wide.add("key" + std::to_string(i), Value::String(std::string(i, 'x')));
  return Value::DictionaryOf({
      {"negative", Value::Integer(-1)},
      {"int64 min", Value::Integer(std::numeric_limits<int64_t>::min())},
      {"int64 max", Value::Integer(std::numeric_limits<int64_t>::max())},
      {"unsigned", Value::Unsigned(uint64_t{1} << 63)},
      {"uint64 max", Value::Unsigned(UINT64_MAX)},
      {"small", Value::Integer(200)},
      {"real", Value::Real(0.1)},
      {"negative real", Value::Real(-2.5e-300)},
      {"negative zero", Value::Real(-0.0)},
      {"whole real", Value::Real(5)},
      {"subnormal", Value::Real(1e-310)},
      {"largest real", Value::Real(std::numeric_limits<double>::max())},
      {"infinity", Value::Real(-std::numeric_limits<double>::infinity())},
      {"true", Value::Boolean(true)},
      {"false", Value::Boolean(false)},
      {"moon landing", Value::DateValue(Date::FromUnix(-14182940))},
      {"year 1900", Value::DateValue(Date::FromUnix(-2208988800))},
      {"after 2038", Value::DateValue(Date::FromUnix(4107585600))},
      {"reference date", Value::DateValue(Date{0})},
      {"ascii", Value::String("plain & <simple>")},
      {"non-ascii", Value::String("Grüße aus Zürich, 日本語, 🎉")},
      {"ключ", Value::String("значение")},
      {"empty string", Value::String("")},
      {"empty data", Value::Data(Bytes{})},
      {"data", Value::Data(Bytes{0x00, 0xff, 0x10, 0x80, 0x7f})},
      {"empty array", Value::ArrayOf({})},
      {"empty dict", Value::DictionaryOf(Dictionary())},
      {"many", Value::ArrayOf(many)},
      {"wide", wide.build()},
      {"nested", Value::ArrayOf({Value::ArrayOf({Value::DictionaryOf({{"deep", Value::Boolean(true)}})})})},
  });
}

Result<Value> ReadBytes(std::span<const uint8_t> bytes) { return ReadPropertyList(bytes); }

std::span<const uint8_t> AsBytes(const std::string& text) {
  return std::span(reinterpret_cast<const uint8_t*>(text.data()), text.size());
}

TEST(PlistRoundTripTest, XmlToBinaryAndBackKeepsEveryValue) {
  const Value original = SampleValue();
  Result<std::string> xml = EncodeXmlPropertyList(original);
  ASSERT_TRUE(xml.ok()) << xml.error().message();
  Result<Value> fromXml = ReadBytes(AsBytes(*xml));
  ASSERT_TRUE(fromXml.ok()) << fromXml.error().message();
  EXPECT_TRUE(*fromXml == original) << fromXml->description();

  Result<Bytes> binary = EncodeBinaryPropertyList(*fromXml);
  ASSERT_TRUE(binary.ok()) << binary.error().message();
  Result<Value> fromBinary = ReadBytes(*binary);
  ASSERT_TRUE(fromBinary.ok()) << fromBinary.error().message();
  EXPECT_TRUE(*fromBinary == original) << fromBinary->description();

  // Value equality compares numbers by value; the XML text also tells an
  // integer from an unsigned from a real, and -0.0 from 0, so it must come
  // out the same.
  Result<std::string> again = EncodeXmlPropertyList(*fromBinary);
  ASSERT_TRUE(again.ok()) << again.error().message();
  EXPECT_EQ(*again, *xml);
}

// Runs a Python program with arguments; its standard output, or nullopt when
// it could not run or failed.
std::optional<std::string> RunPython(const std::string& program, const std::vector<std::string>& args) {
  std::string command = "python3 -c '" + program + "'";
  for (const std::string& arg : args) command += " '" + arg + "'";
  command += " 2>&1";
  FILE* pipe = ::popen(command.c_str(), "r");
  if (pipe == nullptr) return std::nullopt;
  std::string output;
  char buffer[4096];
  for (size_t n; (n = std::fread(buffer, 1, sizeof buffer, pipe)) > 0;) output.append(buffer, n);
  const int status = ::pclose(pipe);
  if (status != 0) {
    ADD_FAILURE() << "python3 failed: " << output;
    return std::nullopt;
  }
  return output;
}

bool HavePython() { return std::system("python3 -c 'import plistlib' >/dev/null 2>&1") == 0; }

TEST(PlistRoundTripTest, PlistlibReadsWhatWeWriteAsEqual) {
  if (!HavePython()) GTEST_SKIP() << "python3 with plistlib is not installed";
  testing::TempDir dir;
  const Value value = SampleValue();
  ASSERT_TRUE(WritePropertyListFile(dir / "a.plist", value, PlistFormat::kXml).ok());
  ASSERT_TRUE(WritePropertyListFile(dir / "b.plist", value, PlistFormat::kBinary).ok());
  // Python's own view of both files, and a check that it matches the sample.
  const std::string program = R"(
import plistlib, sys, datetime
a = plistlib.load(open(sys.argv[1], "rb"))
b = plistlib.load(open(sys.argv[2], "rb"))
ok = (a == b and a["uint64 max"] == 2**64 - 1 and a["int64 min"] == -2**63
      and a["after 2038"] == datetime.datetime(2100, 3, 1, 12, 0, 0)
      and a["year 1900"] == datetime.datetime(1900, 1, 1)
      and a["non-ascii"] == "Grüße aus Zürich, 日本語, 🎉" and a["empty data"] == b""
      and a["real"] == 0.1 and len(a["many"]) == 40 and len(a["wide"]) == 20)
print(ok)
)";
  const std::optional<std::string> output = RunPython(program, {dir / "a.plist", dir / "b.plist"});
  ASSERT_TRUE(output.has_value());
  EXPECT_EQ(*output, "True\n");
}

TEST(PlistRoundTripTest, WeReadWhatPlistlibWrites) {
  if (!HavePython()) GTEST_SKIP() << "python3 with plistlib is not installed";
  testing::TempDir dir;
  const std::string program = R"(
import plistlib, sys, datetime
value = {
    "int": -5, "big": 2**64 - 1, "real": 2.5, "nan": float("nan"), "inf": float("-inf"),
    "date": datetime.datetime(1969, 7, 20, 20, 17, 40), "data": bytes(range(256)), "empty": b"",
    "text": "a & <b> \u00e9\u65e5", "list": [True, False, [], {}], "nested": {"k": [1, {"x": "y"}]},
}
plistlib.dump(value, open(sys.argv[1], "wb"), fmt=plistlib.FMT_XML)
)";
  ASSERT_TRUE(RunPython(program, {dir / "p.plist"}).has_value());
  Result<Value> read = ReadPropertyListFile(dir / "p.plist");
  ASSERT_TRUE(read.ok()) << read.error().message() << "\n" << testing::ReadFile(dir / "p.plist");

  Bytes all(256);
  for (int i = 0; i < 256; ++i) all[i] = static_cast<uint8_t>(i);
  const Value expected = Value::DictionaryOf({
      {"int", Value::Integer(-5)},
      {"big", Value::Unsigned(UINT64_MAX)},
      {"real", Value::Real(2.5)},
      {"inf", Value::Real(-std::numeric_limits<double>::infinity())},
      {"date", Value::DateValue(Date::FromUnix(-14182940))},
      {"data", Value::Data(all)},
      {"empty", Value::Data(Bytes{})},
      {"text", Value::String("a & <b> \xC3\xA9\xE6\x97\xA5")},
      {"list", Value::ArrayOf({Value::Boolean(true), Value::Boolean(false), Value::ArrayOf({}),
                               Value::DictionaryOf(Dictionary())})},
      {"nested", Value::DictionaryOf({{"k", Value::ArrayOf({Value::Integer(1),
                                                            Value::DictionaryOf({{"x", Value::String("y")}})})}})},
  });
  // NaN equals nothing, so it is checked apart from the rest.
  ASSERT_NE(read->dictionary(), nullptr);
  EXPECT_EQ(read->dictionary()->size(), expected.dictionary()->size() + 1);
  for (const auto& [key, value] : *expected.dictionary()) {
    EXPECT_TRUE(read->get(key) == value) << key << ": " << read->get(key).description();
  }
  ASSERT_EQ(read->get("nan").type(), Value::Type::kReal);
  EXPECT_TRUE(std::isnan(*read->get("nan").real()));
  EXPECT_EQ(read->get("big").type(), Value::Type::kUnsigned);
}

// ---- Files -------------------------------------------------------------------

TEST(PlistFileTest, WritesAtomicallyInEitherFormatAndReadsBack) {
  testing::TempDir dir;
  const Value value = SampleValue();
  for (const PlistFormat format : {PlistFormat::kXml, PlistFormat::kBinary}) {
    const std::string path = dir / "out.plist";
    testing::WriteFile(path, "old content");
    ASSERT_TRUE(WritePropertyListFile(path, value, format, 0600).ok());
    struct stat st;
    ASSERT_EQ(::stat(path.c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 07777, 0600u);
    const std::string content = testing::ReadFile(path);
    EXPECT_EQ(content.rfind("bplist00", 0) == 0, format == PlistFormat::kBinary);
    Result<Value> back = ReadPropertyListFile(path);
    ASSERT_TRUE(back.ok()) << back.error().message();
    EXPECT_TRUE(*back == value) << back->description();
  }
  // A value that cannot be written leaves the old file alone and no temporary behind.
  const std::string kept = dir / "kept.plist";
  testing::WriteFile(kept, "keep me");
  EXPECT_FALSE(WritePropertyListFile(kept, Value::ArrayOf({Value()}), PlistFormat::kXml).ok());
  EXPECT_FALSE(WritePropertyListFile(kept, Value::ArrayOf({Value()}), PlistFormat::kBinary).ok());
  EXPECT_EQ(testing::ReadFile(kept), "keep me");
  std::vector<std::string> names;
  for (const auto& entry : std::filesystem::directory_iterator(dir.path())) {
    names.push_back(entry.path().filename());
  }
  std::sort(names.begin(), names.end());
  EXPECT_EQ(names, (std::vector<std::string>{"kept.plist", "out.plist"}));
}

TEST(PlistFileTest, RefusesWhatIsNotARegularFileWithinBounds) {
  testing::TempDir dir;
  const std::string target = dir / "real.plist";
  ASSERT_TRUE(WritePropertyListFile(target, Value::Boolean(true), PlistFormat::kXml).ok());
  ASSERT_EQ(::symlink(target.c_str(), (dir / "link.plist").c_str()), 0);
  ASSERT_EQ(::mkfifo((dir / "fifo.plist").c_str(), 0600), 0);  // must not block the open
  ASSERT_EQ(::mkdir((dir / "dir.plist").c_str(), 0700), 0);

  Result<Value> viaLink = ReadPropertyListFile(dir / "link.plist");
  ASSERT_FALSE(viaLink.ok());
  EXPECT_EQ(viaLink.error().code(), ELOOP);
  EXPECT_FALSE(ReadPropertyListFile(dir / "fifo.plist").ok());
  EXPECT_FALSE(ReadPropertyListFile(dir / "dir.plist").ok());
  Result<Value> missing = ReadPropertyListFile(dir / "missing.plist");
  ASSERT_FALSE(missing.ok());
  EXPECT_EQ(missing.error().code(), ENOENT);

  PlistLimits limits;
  limits.maxInputBytes = 10;
  Result<Value> tooBig = ReadPropertyListFile(target, limits);
  ASSERT_FALSE(tooBig.ok());
  EXPECT_NE(tooBig.error().message().find("larger than the limit"), std::string::npos);

  // A parse failure names the file.
  testing::WriteFile(dir / "bad.plist", "<plist><integer>12abc</integer></plist>");
  Result<Value> bad = ReadPropertyListFile(dir / "bad.plist");
  ASSERT_FALSE(bad.ok());
  EXPECT_EQ(bad.error().message(),
            (dir / "bad.plist") + ": XML property list, line 1: invalid <integer> value \"12abc\"");
}

}  // namespace
}  // namespace vtr
