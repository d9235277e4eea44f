// The binary codec against an independent implementation, Python's plistlib:
// it must read what the streaming writer produces as exactly the values
// written, and we must read what it writes. Skipped where python3 is missing.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <cinttypes>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <string>
#include <vector>

#include "platform/output_stream.h"
#include "platform/plist.h"
#include "platform/unique_fd.h"
#include "tests/platform/strict_value.h"
#include "tests/support/test_support.h"

namespace vtr {
namespace {

bool HavePython() { return std::system("python3 -c 'import plistlib' >/dev/null 2>&1") == 0; }

// Runs the Python program in file `script` with arguments; its output and
// exit status.
std::pair<int, std::string> RunPython(const std::string& script, const std::vector<std::string>& args) {
  std::string command = "python3 '" + script + "'";
  for (const std::string& arg : args) command += " '" + arg + "'";
  command += " 2>&1";
  FILE* pipe = ::popen(command.c_str(), "r");
  if (pipe == nullptr) return {-1, "popen failed"};
  std::string output;
  char buffer[4096];
  for (size_t n; (n = std::fread(buffer, 1, sizeof buffer, pipe)) > 0;) output.append(buffer, n);
  return {::pclose(pipe), output};
}

// value as a Python expression, built so that Python needs no escaping rules
// of ours: text as hex-encoded UTF-8, reals bit for bit, dates as the seconds
// since 2001 plistlib itself converts.
std::string PythonExpression(const Value& value) {
  auto hex = [](const void* bytes, size_t length) {
    std::string text;
    char digits[3];
    for (size_t i = 0; i < length; ++i) {
      std::snprintf(digits, sizeof digits, "%02x", static_cast<const uint8_t*>(bytes)[i]);
      text += digits;
    }
    return text;
  };
  auto str = [&](const std::string& s) { return "S('" + hex(s.data(), s.size()) + "')"; };
  switch (value.type()) {
    case Value::Type::kBoolean:
      return *value.boolean() ? "True" : "False";
    case Value::Type::kInteger:
      return std::to_string(*value.integer());
    case Value::Type::kUnsigned:
      return std::to_string(*value.unsignedInteger());
    case Value::Type::kReal: {
      char text[64];
      std::snprintf(text, sizeof text, "float.fromhex('%a')", *value.real());
      return text;
    }
    case Value::Type::kDate: {
      char text[64];
      std::snprintf(text, sizeof text, "D(float.fromhex('%a'))", value.date()->secondsSince2001);
      return text;
    }
    case Value::Type::kString:
      return str(*value.string());
    case Value::Type::kData:
      return "bytes.fromhex('" + hex(value.data()->data(), value.data()->size()) + "')";
    case Value::Type::kArray: {
      std::string text = "[";
      for (const Value& item : *value.array()) text += PythonExpression(item) + ",";
      return text + "]";
    }
    case Value::Type::kDictionary: {
      std::string text = "{";
      for (const auto& [key, item] : *value.dictionary()) text += str(key) + ":" + PythonExpression(item) + ",";
      return text + "}";
    }
    default:
      return "None";
  }
}

// Compares plistlib's reading of argv[1] with the expression in argv[2],
// types included (bool is not int, float is not int).
constexpr char kCompareScript[] = R"(
import datetime, math, plistlib, struct, sys
def S(h): return bytes.fromhex(h).decode("utf-8")
def D(s): return datetime.datetime(2001, 1, 1) + datetime.timedelta(seconds=s)
def diff(a, b, path):
    if type(a) is not type(b): return f"{path}: {type(a).__name__} {a!r} vs {type(b).__name__} {b!r}"
    if isinstance(a, list):
        if len(a) != len(b): return f"{path}: {len(a)} items vs {len(b)}"
        for i, (x, y) in enumerate(zip(a, b)):
            d = diff(x, y, f"{path}/{i}")
            if d: return d
        return None
    if isinstance(a, dict):
        if sorted(a) != sorted(b): return f"{path}: keys {sorted(a)[:5]} vs {sorted(b)[:5]}"
        for k in a:
            d = diff(a[k], b[k], f"{path}/{k}")
            if d: return d
        return None
    if isinstance(a, float): same = struct.pack(">d", a) == struct.pack(">d", b)
    else: same = a == b
    return None if same else f"{path}: {a!r} vs {b!r}"
read = plistlib.load(open(sys.argv[1], "rb"))
expected = eval(open(sys.argv[2]).read())
print(diff(read, expected, "") or "same")
)";

Value Record(int i) {
  DictionaryBuilder attributes;  // more than 14 entries: an extended count
  for (int k = 0; k < 16; ++k) attributes.add("NSFileAttribute" + std::to_string(k), Value::Integer(k * i - 7));
  attributes.add("NSFileSize", Value::Unsigned(UINT64_MAX - static_cast<uint64_t>(i)));
  attributes.add("NSFileModificationDate", Value::DateValue(Date::FromUnix(4107585600 + i)));  // after 2038
  attributes.add("NSFileCreationDate", Value::DateValue(Date::FromUnix(-14182940 - i)));       // before 2001
  attributes.add("NSFileOwnerAccountName", Value::String(i % 2 ? "mobile" : "r\xC3\xA9sum\xC3\xA9 \xF0\x9F\x93\x84"));
  attributes.add("Ratio", Value::Real(i / 3.0));
  attributes.add("NSFileImmutable", Value::Boolean(i % 3 == 0));
  return Value::DictionaryOf({
      {"VTRManifestFileAttributes", attributes.build()},
      {"VTRManifestFileExtendedAttributes",
       Value::DictionaryOf({{"user.empty", Value::Data(Bytes{})}, {"user.tag", Value::Data(Bytes(3, i % 256))}})},
      {"VTRManifestFileHash", Value::Data(Bytes(20, static_cast<uint8_t>(i * 7)))},
      {"VTRManifestSymbolicLinkTargetFile",
       Value::String(i % 5 ? "" : "../\xE6\x97\xA5\xE6\x9C\xAC/" + std::to_string(i))},
  });
}

TEST(BinaryPlistPythonTest, PlistlibReadsTheStreamedDictionaryAsWritten) {
  if (!HavePython()) GTEST_SKIP() << "python3 with plistlib is not installed";
  testing::TempDir dir;
  DictionaryBuilder expected;
  {
    UniqueFd fd(::open((dir / "manifest.plist").c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600));
    ASSERT_TRUE(fd.valid());
    FdOutputStream out(fd.get());
    BinaryPlistDictionaryWriter writer(&out);
    for (int i = 0; i < 2000; ++i) {
      const std::string path = "/private/var/\xD0\xB4\xD0\xB0\xD0\xBD\xD0\xBD\xD1\x8B\xD0\xB5/" + std::to_string(i);
      ASSERT_TRUE(writer.add(path, Record(i)).ok());
      if (i != 10) expected.add(path, Record(i));
    }
    const std::string replaced = "/private/var/\xD0\xB4\xD0\xB0\xD0\xBD\xD0\xBD\xD1\x8B\xD0\xB5/10";
    ASSERT_TRUE(writer.add(replaced, Value::ArrayOf({Value::Integer(-1)})).ok());
    expected.add(replaced, Value::ArrayOf({Value::Integer(-1)}));
    ASSERT_TRUE(writer.finish().ok());
  }
  testing::WriteFile(dir / "compare.py", kCompareScript);
  testing::WriteFile(dir / "expected.py", PythonExpression(expected.build()));
  const auto [status, output] = RunPython(dir / "compare.py", {dir / "manifest.plist", dir / "expected.py"});
  EXPECT_EQ(status, 0);
  EXPECT_EQ(output, "same\n");
}

TEST(BinaryPlistPythonTest, WeReadWhatPlistlibWritesInBinary) {
  if (!HavePython()) GTEST_SKIP() << "python3 with plistlib is not installed";
  testing::TempDir dir;
  testing::WriteFile(dir / "write.py", R"(
import datetime, plistlib, sys
value = {
    "ints": [0, 255, 256, 65536, 2**32, 2**63 - 1, -1, -2**63, 2**64 - 1],
    "reals": [0.5, -0.0, 1e300, float("inf")],
    "dates": [datetime.datetime(1969, 7, 20, 20, 17, 40), datetime.datetime(2100, 3, 1, 12)],
    "texts": ["", "plain", "a" * 20, "caf\u00e9", "\U0001F389 party", "same", "same"],
    "data": [b"", bytes(range(256))],
    "flags": [True, False],
    "wide": {f"key{i:02}": i for i in range(20)},
    "nested": {"empty list": [], "empty dict": {}, "list": [[["deep"]]]},
}
plistlib.dump(value, open(sys.argv[1], "wb"), fmt=plistlib.FMT_BINARY)
)");
  const auto [status, output] = RunPython(dir / "write.py", {dir / "python.plist"});
  ASSERT_EQ(status, 0) << output;
  const std::string file = testing::ReadFile(dir / "python.plist");
  Result<Value> read = ReadBinaryPropertyList(std::span(reinterpret_cast<const uint8_t*>(file.data()), file.size()));
  ASSERT_TRUE(read.ok()) << read.error().message();

  Bytes all(256);
  for (int i = 0; i < 256; ++i) all[i] = static_cast<uint8_t>(i);
  DictionaryBuilder wide;
  for (int i = 0; i < 20; ++i) wide.add((i < 10 ? "key0" : "key") + std::to_string(i), Value::Integer(i));
  auto integers = [](std::initializer_list<int64_t> list) {
    Array items;
    for (int64_t i : list) items.push_back(Value::Integer(i));
    return items;
  };
  Array ints = integers({0, 255, 256, 65536, int64_t{1} << 32, std::numeric_limits<int64_t>::max(), -1,
                         std::numeric_limits<int64_t>::min()});
  ints.push_back(Value::Unsigned(UINT64_MAX));
  const Value expected = Value::DictionaryOf({
      {"ints", Value::ArrayOf(ints)},
      {"reals", Value::ArrayOf({Value::Real(0.5), Value::Real(-0.0), Value::Real(1e300),
                                Value::Real(std::numeric_limits<double>::infinity())})},
      {"dates",
       Value::ArrayOf({Value::DateValue(Date::FromUnix(-14182940)), Value::DateValue(Date::FromUnix(4107585600))})},
      {"texts", Value::ArrayOf({Value::String(""), Value::String("plain"), Value::String(std::string(20, 'a')),
                                Value::String("caf\xC3\xA9"), Value::String("\xF0\x9F\x8E\x89 party"),
                                Value::String("same"), Value::String("same")})},
      {"data", Value::ArrayOf({Value::Data(Bytes{}), Value::Data(all)})},
      {"flags", Value::ArrayOf({Value::Boolean(true), Value::Boolean(false)})},
      {"wide", wide.build()},
      {"nested",
       Value::DictionaryOf({{"empty list", Value::ArrayOf({})},
                            {"empty dict", Value::DictionaryOf(Dictionary())},
                            {"list", Value::ArrayOf({Value::ArrayOf({Value::ArrayOf({Value::String("deep")})})})}})},
  });
  EXPECT_TRUE(testing::StrictlyEqual(*read, expected));
}

}  // namespace
}  // namespace vtr
