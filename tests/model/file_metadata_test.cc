// File metadata records read from disk (and cut short when parts cannot be
// read), and the typed getters over malformed dictionaries.
#include "model/file_metadata.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "platform/accounts.h"
#include "platform/file_manager.h"
#include "platform/unique_fd.h"
#include "tests/support/failing_syscall.h"
#include "tests/support/test_support.h"

namespace vtr {
namespace {

using testing::LogCapture;
using testing::TempDir;
using testing::WriteFile;

Value DataOf(const std::string& text) { return Value::Data(text.data(), text.size()); }
const Value kEmpty = Value::DictionaryOf(Dictionary());

// "keys of the record; hash bytes" and the log lines, one per line. With a
// directory descriptor, the record is made of the entry relative to it.
std::string DescribeRecordOf(const std::string& path, int dirFd = -1) {
  LogCapture log;
  std::optional<VTRFileMetadata> record =
      dirFd < 0 ? VTRFileMetadata::initWithPath(path)
                : VTRFileMetadata::initWithItemAt(dirFd, path.substr(path.rfind('/') + 1), path);
  std::string text = record ? "" : "no record";
  if (record) {
    for (const auto& entry : *record->dict().dictionary()) text += entry.first + " ";
    text += record->getHash() ? "hash " + std::to_string(record->getHash()->size()) : "no hash";
  }
  for (const std::string& line : log.messages()) text += "\n" + line;
  return text;
}

const std::string kAllKeys =
    "VTRManifestFileAttributes VTRManifestFileExtendedAttributes VTRManifestFileHash "
    "VTRManifestSymbolicLinkTargetFile ";

TEST(FileMetadataTest, RecordsEachKindOfItem) {
  TempDir dir;
  WriteFile(dir / "file", "hello");
  ASSERT_EQ(::setxattr((dir / "file").c_str(), "user.b", "22", 2, 0), 0) << "no user xattrs here";
  ASSERT_EQ(::setxattr((dir / "file").c_str(), "user.a", "1", 1, 0), 0);
  ASSERT_EQ(::setxattr((dir / "file").c_str(), "user.empty", "", 0, 0), 0);
  WriteFile(dir / "plain", "");
  ASSERT_EQ(::mkdir((dir / "dir").c_str(), 0700), 0);
  ASSERT_EQ(::symlink("file", (dir / "link").c_str()), 0);
  ASSERT_EQ(::symlink("../nowhere", (dir / "dangling").c_str()), 0);

  const Value noHash = Value::Data(Bytes());
  const struct {
    std::string name;
    const char* type;
    Value hash;
    std::string target;
    Value xattrs;
  } cases[] = {
      {"file", kNSFileTypeRegular,
       Value::Data(Bytes{0xaa, 0xf4, 0xc6, 0x1d, 0xdc, 0xc5, 0xe8, 0xa2, 0xda, 0xbe,
                         0xde, 0x0f, 0x3b, 0x48, 0x2c, 0xd9, 0xae, 0xa9, 0x43, 0x4d}),  // SHA-1 of "hello"
       "", Value::DictionaryOf({{"user.a", DataOf("1")}, {"user.b", DataOf("22")}, {"user.empty", DataOf("")}})},
      {"plain", kNSFileTypeRegular,
       Value::Data(Bytes{0xda, 0x39, 0xa3, 0xee, 0x5e, 0x6b, 0x4b, 0x0d, 0x32, 0x55,
                         0xbf, 0xef, 0x95, 0x60, 0x18, 0x90, 0xaf, 0xd8, 0x07, 0x09}),  // of nothing
       "", kEmpty},
      {"dir", kNSFileTypeDirectory, noHash, "", kEmpty},
      {"link", kNSFileTypeSymbolicLink, noHash, "file", kEmpty},
      {"dangling", kNSFileTypeSymbolicLink, noHash, "../nowhere", kEmpty},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    EXPECT_EQ(DescribeRecordOf(dir / c.name), kAllKeys + "hash " + std::to_string(c.hash.data()->size()));
    std::optional<VTRFileMetadata> record = VTRFileMetadata::fileMetadatatWithPath(dir / c.name);
    ASSERT_TRUE(record.has_value());
    EXPECT_EQ(*record->getFileType(), c.type);
    EXPECT_EQ(record->dict().get(kVTRManifestFileHash), c.hash);
    EXPECT_EQ(*record->getTargetFile(), c.target);
    EXPECT_EQ(record->dict().get(kVTRManifestFileExtendedAttributes), c.xattrs);
    // The attributes are those of the item itself, not of what a link names.
    EXPECT_EQ(record->getFileAttributes()->find(kNSFileSystemFileNumber)->unsignedInteger(),
              AttributesOfItem(dir / c.name)->get(kNSFileSystemFileNumber).unsignedInteger());
  }

  const std::string missing = dir / "missing";
  EXPECT_EQ(DescribeRecordOf(missing), "no record\nGet file attributes failed for " + missing + " with error - " +
                                           missing + ": No such file or directory\nCannot get file attribute for " +
                                           missing);
  ASSERT_EQ(::mkfifo((dir / "fifo").c_str(), 0600), 0);
  EXPECT_EQ(DescribeRecordOf(dir / "fifo"), kAllKeys + "hash 0\nCannot read file " + dir / "fifo" +
                                                "\nMaybe it's an Nimbrel file (" + dir / "fifo" + ")?");
}

TEST(FileMetadataTest, UnreadablePartsCutTheRecordShortOrEmptyTheHash) {
  if (!testing::CanFailSyscalls()) GTEST_SKIP() << "no seccomp filter for this architecture";
  TempDir dir;
  const std::string file = dir / "file";
  const std::string link = dir / "link";
  WriteFile(file, "content");
  ASSERT_EQ(::symlink("file", link.c_str()), 0);
  AccountDatabase::Shared();  // read now, before the filters could break its reading
  // Opened before the filters: with opens failing, only the item itself
  // cannot be opened.
  const UniqueFd dirFd(::open(dir.path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  ASSERT_TRUE(dirFd.valid());
  const long kListXattrAt = 465;  // listxattrat, which a link's own list comes from
  const struct {
    std::vector<long> calls;
    int error;
    std::string path;
    std::string expected;
  } cases[] = {
      {{SYS_flistxattr}, EIO, file,
       "VTRManifestFileAttributes no hash\nCould not extract extended attributes from " + file +
           ".\nCould not get attribute keys from file " + file},
      {{kListXattrAt}, EIO, link,
       "VTRManifestFileAttributes no hash\nCould not extract extended attributes from " + link +
           ".\nCould not get attribute keys from file " + link},
      // The list then comes relative to the directory instead.
      {{SYS_openat}, EACCES, file,
       kAllKeys + "hash 0\nCannot read file " + file + "\nMaybe it's an Nimbrel file (" + file + ")?"},
      {{SYS_readlinkat}, EIO, link,
       "VTRManifestFileAttributes VTRManifestFileExtendedAttributes VTRManifestFileHash hash 0\n"
       "Could not get destination of symbolic link " + link + " with error - " + link + ": Input/output error"},
  };
  for (const auto& c : cases) {
    EXPECT_EQ(testing::RunWithFailingSyscalls(c.calls, c.error,
                                              [&] { return DescribeRecordOf(c.path, dirFd.get()); }),
              c.expected);
  }
}

TEST(FileMetadataTest, GettersAnswerNothingForMissingOrMistypedValues) {
  const Value wellFormed = Value::DictionaryOf({
      {kVTRManifestFileAttributes, Value::DictionaryOf({{kNSFileType, Value::String(kNSFileTypeRegular)},
                                                        {kNSFileSize, Value::Unsigned(1234)}})},
      {kVTRManifestFileExtendedAttributes, kEmpty},
      {kVTRManifestFileHash, DataOf("h")},
      {kVTRManifestSymbolicLinkTargetFile, Value::String("")},
  });
  VTRFileMetadata good = VTRFileMetadata::fileMetaDataWithMetadataDictionary(wellFormed);
  EXPECT_TRUE(good.getFileAttributes() && good.getExtendedAttributes() && good.getHash() && good.getTargetFile());
  EXPECT_EQ(good.getFileSize(), 1234u);
  EXPECT_EQ(good.dict().dictionary(), wellFormed.dictionary()) << "the dictionary is kept, not copied";

  const Value malformed[] = {
      Value(),
      Value::String("not a dictionary"),
      kEmpty,
      Value::DictionaryOf({
          {kVTRManifestFileAttributes, Value::ArrayOf({})},
          {kVTRManifestFileExtendedAttributes, Value::String("x")},
          {kVTRManifestFileHash, Value::String("x")},
          {kVTRManifestSymbolicLinkTargetFile, DataOf("x")},
      }),
      Value::DictionaryOf({{kVTRManifestFileAttributes, Value::DictionaryOf({{kNSFileType, Value::Integer(1)},
                                                                             {kNSFileSize, Value::Integer(5)}})}}),
  };
  for (const Value& dict : malformed) {
    VTRFileMetadata record(dict);
    EXPECT_FALSE(record.getExtendedAttributes() || record.getHash() || record.getTargetFile() ||
                 record.getFileType())
        << dict.description();
    EXPECT_EQ(record.getFileSize(), 0u);
  }
}

TEST(FileMetadataTest, FileSizeCountsOnlyRegularFiles) {
  const struct {
    Value type;
    Value size;
    uint64_t expected;
  } cases[] = {
      {Value::String(kNSFileTypeRegular), Value::Unsigned(UINT64_MAX), UINT64_MAX},
      {Value::String(kNSFileTypeRegular), Value::String("77"), 0},
      {Value::String(kNSFileTypeDirectory), Value::Unsigned(4096), 0},
      {Value::String(kNSFileTypeSymbolicLink), Value::Unsigned(12), 0},
  };
  for (const auto& c : cases) {
    DictionaryBuilder attributes;
    attributes.add(kNSFileType, c.type);
    if (!c.size.isNil()) attributes.add(kNSFileSize, c.size);
    VTRFileMetadata record(Value::DictionaryOf({{kVTRManifestFileAttributes, attributes.build()}}));
    EXPECT_EQ(record.getFileSize(), c.expected) << c.type.description() << " " << c.size.description();
  }
}

TEST(FileMetadataTest, OnlySettableAttributesAreRestored) {
  const Dictionary filtered = VTRFileMetadata::fileAttributesAllowSet(Dictionary({
      {kNSFilePosixPermissions, Value::Integer(0644)},
      {kNSFileOwnerAccountName, Value::String("mobile")},
      {kNSFileImmutable, Value::Boolean(false)},
      {kNSFileProtectionKey, Value::String(kNSFileProtectionNone)},  // set in a step of its own
      {kNSFileAppendOnly, Value::Boolean(false)},
      {kNSFileType, Value::String(kNSFileTypeRegular)},
      {kNSFileSize, Value::Unsigned(1)},
      {"nsfileposixpermissions", Value::Integer(0)},
  }));
  std::vector<std::string> keys;
  for (const auto& entry : filtered) keys.push_back(entry.first);
  EXPECT_EQ(keys, (std::vector<std::string>{kNSFileImmutable, kNSFileOwnerAccountName, kNSFilePosixPermissions}));

  // Laid onto an item, a key the restore does not set is passed over even
  // when its value could not be used.
  TempDir dir;
  WriteFile(dir / "f", "x");
  const VTRFileMetadata record(Value::DictionaryOf({{kVTRManifestFileAttributes, Value::DictionaryOf({
                                                         {kNSFilePosixPermissions, Value::Integer(0604)},
                                                         {kNSFileAppendOnly, Value::String("yes")},
                                                         {kNSFileType, Value::String(kNSFileTypeRegular)},
                                                     })}}));
  UniqueFd folder(::open(dir.path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  LogCapture log;
  EXPECT_TRUE(record.restoreAttribuesToItemAt(folder.get(), "f", dir / "f", ClientAccount{0, 0})) << ::testing::PrintToString(log.messages());
  struct stat st;
  ASSERT_EQ(::stat((dir / "f").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0604u);
}

}  // namespace
}  // namespace vtr
