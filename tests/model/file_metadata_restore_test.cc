// Laying a file metadata record onto an item, and comparing two records.
#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/syscall.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <functional>

#include <gtest/gtest.h>

#include "model/file_hash.h"
#include "model/file_metadata.h"
#include "platform/file_manager.h"
#include "platform/unique_fd.h"
#include "tests/support/failing_syscall.h"
#include "tests/support/file_inspection.h"
#include "tests/support/test_support.h"

namespace vtr {
namespace {

using testing::IsRoot;
using testing::Lstat;
using testing::LogCapture;
using testing::TempDir;
using testing::WriteFile;
using testing::Xattr;

Value DataOf(const std::string& text) { return Value::Data(text.data(), text.size()); }

// The parts of a record, to be varied one at a time.
struct Parts {
  const char* type = kNSFileTypeRegular;
  Value hash = DataOf("01234567890123456789");
  Value target = Value::String("");
  std::vector<Dictionary::Entry> attributes = {{kNSFileOwnerAccountID, Value::Integer(501)},
                                               {kNSFileGroupOwnerAccountID, Value::Integer(501)},
                                               {kNSFilePosixPermissions, Value::Integer(0644)}};
  Value xattrs = Value::DictionaryOf({{"user.a", DataOf("1")}, {kIgnoredExtendedAttribute, DataOf("u1")}});

  VTRFileMetadata record() const {
    std::vector<Dictionary::Entry> entries = attributes;
    if (type != nullptr) entries.emplace_back(kNSFileType, Value::String(type));
    return VTRFileMetadata(Value::DictionaryOf({{kVTRManifestFileAttributes, Value::DictionaryOf(Dictionary(entries))},
                                                {kVTRManifestFileExtendedAttributes, xattrs},
                                                {kVTRManifestFileHash, hash},
                                                {kVTRManifestSymbolicLinkTargetFile, target}}));
  }
};

TEST(RestoreAttributesTest, LaysARecordedFileOntoAnother) {
  TempDir dir;
  WriteFile(dir / "source", "s");
  ASSERT_EQ(::chmod((dir / "source").c_str(), 0640), 0);
  ASSERT_EQ(::setxattr((dir / "source").c_str(), "user.a", "1", 1, 0), 0) << "no user xattrs here";
  const struct timespec times[2] = {{1400000000, 0}, {1400000000, 5000}};
  ASSERT_EQ(::utimensat(AT_FDCWD, (dir / "source").c_str(), times, 0), 0);
  if (IsRoot()) {
    ASSERT_EQ(::chown((dir / "source").c_str(), 501, 502), 0);
  }
  std::optional<VTRFileMetadata> record = VTRFileMetadata::initWithPath(dir / "source");
  ASSERT_TRUE(record.has_value());

  WriteFile(dir / "target", "t");
  ASSERT_EQ(::chmod((dir / "target").c_str(), 0606), 0);
  ASSERT_EQ(::setxattr((dir / "target").c_str(), "user.keep", "k", 1, 0), 0);
  LogCapture log;
  EXPECT_TRUE(record->restoreAttribuesToPath(dir / "target"));
  EXPECT_TRUE(log.messages().empty());
  const struct stat st = Lstat(dir / "target");
  EXPECT_EQ(st.st_mode & 07777, 0640u);
  EXPECT_EQ(st.st_mtim.tv_sec, 1400000000);
  EXPECT_EQ(Xattr(dir / "target", "user.a"), "1");
  EXPECT_EQ(Xattr(dir / "target", "user.keep"), "k") << "attributes absent from the record are kept";
  if (IsRoot()) {
    EXPECT_EQ(st.st_uid, 501u);
    EXPECT_EQ(st.st_gid, 502u);
  }
}

TEST(RestoreAttributesTest, ARecordedFileIsNeverLaidThroughALink) {
  TempDir dir;
  WriteFile(dir / "file", "x");
  ASSERT_EQ(::chmod((dir / "file").c_str(), 0600), 0);
  ASSERT_EQ(::symlink("file", (dir / "link").c_str()), 0);
  Parts ownerOnly;
  ownerOnly.attributes = {{kNSFileOwnerAccountID, Value::Integer(Lstat(dir / "file").st_uid)}};
  // A full record of the file, and one that would change only ownership.
  for (const VTRFileMetadata& record : {*VTRFileMetadata::initWithPath(dir / "file"), ownerOnly.record()}) {
    LogCapture log;
    EXPECT_FALSE(record.restoreAttribuesToPath(dir / "link"));
    ASSERT_EQ(log.messages().size(), 1u);
    const std::string expectedStart = "Could not set file attributs at " + dir / "link" + " with error - " +
                                      dir / "link" + ": Too many levels of symbolic links, attributes = {";
    EXPECT_EQ(log.messages()[0].substr(0, expectedStart.size()), expectedStart);
  }
  EXPECT_EQ(Lstat(dir / "file").st_mode & 07777, 0600u);
}

TEST(RestoreAttributesTest, ExtendedAttributeFailuresCountOnlyForLinks) {
  TempDir dir;
  WriteFile(dir / "file", "x");
  ASSERT_EQ(::symlink("file", (dir / "link").c_str()), 0);
  Parts parts;
  parts.attributes = {{kNSFileOwnerAccountID, Value::Integer(Lstat(dir / "file").st_uid)},
                      {kNSFilePosixPermissions, Value::Integer(0644)},
                      {kNSFileProtectionKey, Value::String("NSFileProtectionComplete")}};
  // "bogus" has no namespace, so no file system takes it; a link takes no
  // "user." attribute either.
  const struct {
    const char* type;
    Value xattrs;
    bool expected;
    std::string lastMessage;  // the start of the last line logged; empty: nothing logged
  } cases[] = {
      {kNSFileTypeRegular, Value::DictionaryOf({{"bogus", DataOf("v")}}), true,
       "Could not set extended attributes on "},
      {kNSFileTypeRegular, Value::DictionaryOf({{"user.v", Value::Integer(1)}}), true, "Got non-data value"},
      {kNSFileTypeRegular, Value::DictionaryOf({{std::string("user.a\0b", 8), DataOf("v")}}), true,
       "Got Non-string key"},
      {kNSFileTypeRegular, Value::String("junk"), true, ""},
      {kNSFileTypeSymbolicLink, Value::DictionaryOf({{"user.a", DataOf("v")}}), false,
       "Could not set extended attributes on "},
      {kNSFileTypeSymbolicLink, Value::DictionaryOf({{"trusted.v", Value::String("s")}}), false,
       "Got non-data value"},
      {kNSFileTypeSymbolicLink, Value::DictionaryOf(Dictionary()), true, ""},
      {kNSFileTypeSymbolicLink, Value(), true, ""},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(std::string(c.type) + " " + c.xattrs.description());
    parts.type = c.type;
    parts.xattrs = c.xattrs;
    LogCapture log;
    const bool isLink = c.type == std::string(kNSFileTypeSymbolicLink);
    EXPECT_EQ(parts.record().restoreAttribuesToPath(dir / (isLink ? "link" : "file")), c.expected);
    const std::vector<std::string> lines = log.messages();
    if (c.lastMessage.empty()) {
      EXPECT_TRUE(lines.empty()) << lines.front();
    } else {
      ASSERT_FALSE(lines.empty());
      EXPECT_EQ(lines.back().substr(0, c.lastMessage.size()), c.lastMessage);
    }
  }
  EXPECT_EQ(Xattr(dir / "file", "bogus"), "<none>");
}

TEST(RestoreAttributesTest, ALinkRecordChangesTheLinkItself) {
  if (!IsRoot()) GTEST_SKIP() << "changing owners needs root";
  TempDir dir;
  WriteFile(dir / "file", "x");
  ASSERT_EQ(::symlink("file", (dir / "link").c_str()), 0);
  ASSERT_EQ(::symlink("file", (dir / "source").c_str()), 0);
  ASSERT_EQ(::lchown((dir / "source").c_str(), 601, 602), 0);
  std::optional<VTRFileMetadata> record = VTRFileMetadata::initWithPath(dir / "source");
  ASSERT_TRUE(record.has_value());
  EXPECT_TRUE(record->restoreAttribuesToPath(dir / "link"));
  EXPECT_EQ(Lstat(dir / "link").st_uid, 601u);
  EXPECT_EQ(Lstat(dir / "link").st_gid, 602u);
  EXPECT_EQ(Lstat(dir / "file").st_uid, 0u) << "the link was followed";
}

// A record of an immutable file with extended attributes, laid twice onto
// the same file (the second time over the flag the first set): handed to
// its owner, made root's in place under a lease, and made root's on a
// verified copy where no lease can be had (no CAP_LEASE).
TEST(RestoreAttributesTest, AnImmutableFileTakesItsExtendedAttributesEveryTime) {
  if (!IsRoot()) GTEST_SKIP() << "flags need CAP_LINUX_IMMUTABLE";
  TempDir dir;
  WriteFile(dir / "f", "content");
  UniqueFd folder(::open(dir.path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  const ClientAccount client{501, 501};
  const Bytes sha1 = *fileHash(dir / "f");
  const struct {
    uid_t owner;
    bool lease;
  } variants[] = {{501, true}, {0, true}, {0, false}};
  for (const auto [owner, lease] : variants) {
    SCOPED_TRACE(::testing::Message() << owner << (lease ? " leased" : " copied"));
    ASSERT_EQ(::chown((dir / "f").c_str(), 501, 501), 0);
    Parts parts;
    parts.hash = Value::Data(sha1);
    parts.attributes = {{kNSFileOwnerAccountID, Value::Integer(owner)},
                        {kNSFileGroupOwnerAccountID, Value::Integer(owner)},
                        {kNSFilePosixPermissions, Value::Integer(0644)},
                        {kNSFileImmutable, Value::Boolean(true)}};
    for (const char* value : {"2", "3"}) {
      parts.xattrs = Value::DictionaryOf({{"trusted.a", DataOf("1")}, {"user.b", DataOf(value)}});
      LogCapture log;
      const auto restore = [&] {
        return std::string(parts.record().restoreAttribuesToItemAt(folder.get(), "f", dir / "f", client) ? "YES" : "NO");
      };
      EXPECT_EQ(lease ? restore() : testing::RunWithFailingSyscalls({SYS_fcntl}, EPERM, restore), "YES") << value;
      EXPECT_TRUE(log.messages().empty()) << log.messages().front();
      EXPECT_EQ(Xattr(dir / "f", "trusted.a"), "1");
      EXPECT_EQ(Xattr(dir / "f", "user.b"), value);
      EXPECT_EQ(Lstat(dir / "f").st_uid, owner);
    }
    // Set by both passes; cleared for the next owner.
    UniqueFd file(::open((dir / "f").c_str(), O_RDONLY | O_CLOEXEC));
    int flags = 0;
    ASSERT_EQ(::ioctl(file.get(), FS_IOC_GETFLAGS, &flags), 0);
    EXPECT_TRUE(flags & FS_IMMUTABLE_FL);
    flags &= ~FS_IMMUTABLE_FL;
    ASSERT_EQ(::ioctl(file.get(), FS_IOC_SETFLAGS, &flags), 0);
  }
}

// What a privileged record leaves out stays as the staged file had it, in
// place and on a copy: a set-uid record without an owner keeps mobile's, an
// owner without a mode keeps the file's mode.
TEST(RestoreAttributesTest, WhatAPrivilegedRecordLeavesOutStaysTheFiles) {
  if (!IsRoot()) GTEST_SKIP() << "changing owners needs root";
  TempDir dir;
  WriteFile(dir / "f", "content");
  UniqueFd folder(::open(dir.path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  const struct {
    std::vector<Dictionary::Entry> attributes;
    uid_t owner;
    mode_t mode;
  } cases[] = {{{{kNSFilePosixPermissions, Value::Integer(04755)}}, 501, 04755},
               {{{kNSFileOwnerAccountID, Value::Integer(0)}}, 0, 0604}};
  for (const auto& c : cases) {
    for (const bool lease : {true, false}) {
      ASSERT_EQ(::chown((dir / "f").c_str(), 501, 501), 0);
      ASSERT_EQ(::chmod((dir / "f").c_str(), 0604), 0);
      Parts parts;
      parts.hash = Value::Data(*fileHash(dir / "f"));
      parts.attributes = c.attributes;
      const auto restore = [&] {
        return std::string(parts.record().restoreAttribuesToItemAt(folder.get(), "f", dir / "f", {501, 501}) ? "YES"
                                                                                                             : "NO");
      };
      EXPECT_EQ(lease ? restore() : testing::RunWithFailingSyscalls({SYS_fcntl}, EPERM, restore), "YES");
      EXPECT_EQ(Lstat(dir / "f").st_uid, c.owner) << lease;
      EXPECT_EQ(Lstat(dir / "f").st_mode & 07777, c.mode) << lease;
    }
  }
}

// Extended attributes of a link go onto the link, on kernels with
// setxattrat and on those without.
TEST(RestoreAttributesTest, ALinkTakesItsExtendedAttributesOnEveryKernel) {
  if (!IsRoot() || !testing::CanFailSyscalls()) GTEST_SKIP() << "trusted attributes need root";
  TempDir dir;
  WriteFile(dir / "file", "x");
  UniqueFd folder(::open(dir.path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  Parts parts;
  parts.type = kNSFileTypeSymbolicLink;
  parts.attributes = {{kNSFileOwnerAccountID, Value::Integer(0)}, {kNSFileGroupOwnerAccountID, Value::Integer(0)}};
  parts.xattrs = Value::DictionaryOf({{"trusted.v", DataOf("1")}});
  const long kSetXattrAt = 463;
  for (const char* link : {"now", "before-6.13"}) {
    ASSERT_EQ(::symlink("file", (dir / link).c_str()), 0);
    const auto restore = [&] {
      return parts.record().restoreAttribuesToItemAt(folder.get(), link, dir / link, ClientAccount{501, 501})
                 ? Xattr(dir / link, "trusted.v")
                 : "NO";
    };
    EXPECT_EQ(link == std::string("now") ? restore() : testing::RunWithFailingSyscalls({kSetXattrAt}, ENOSYS, restore),
              "1")
        << link;
    EXPECT_EQ(Xattr(dir / "file", "trusted.v"), "<none>") << "followed";
  }
}

TEST(CompareRecordsTest, ReportsTheFirstDifference) {
  using Change = std::function<void(Parts&)>;
  const struct {
    const char* name;
    Change mine;
    Change theirs;
    int expected;
  } cases[] = {
      {"same", nullptr, nullptr, kVTRFileSame},
      {"type", nullptr, [](Parts& p) { p.type = kNSFileTypeDirectory; }, kVTRFileTypeDiffers},
      {"type absent there", nullptr, [](Parts& p) { p.type = nullptr; }, kVTRFileTypeDiffers},
      {"type absent on both sides", [](Parts& p) { p.type = nullptr; }, [](Parts& p) { p.type = nullptr; },
       kVTRFileTypeDiffers},
      {"hash", nullptr, [](Parts& p) { p.hash = DataOf("x"); }, kVTRFileHashDiffers},
      {"hash absent on both sides", [](Parts& p) { p.hash = Value(); }, [](Parts& p) { p.hash = Value(); },
       kVTRFileHashDiffers},
      {"a directory's hash is not compared", [](Parts& p) { p.type = kNSFileTypeDirectory; },
       [](Parts& p) { p.type = kNSFileTypeDirectory, p.hash = DataOf("x"); }, kVTRFileSame},
      {"link target", [](Parts& p) { p.type = kNSFileTypeSymbolicLink, p.target = Value::String("a"); },
       [](Parts& p) { p.type = kNSFileTypeSymbolicLink, p.target = Value::String("b"); }, kVTRFileTargetDiffers},
      {"owner", nullptr, [](Parts& p) { p.attributes[0].second = Value::Integer(0); }, kVTRFileOwnershipDiffers},
      {"group missing there", nullptr, [](Parts& p) { p.attributes.erase(p.attributes.begin() + 1); },
       kVTRFileOwnershipDiffers},
      {"mode", nullptr, [](Parts& p) { p.attributes[2].second = Value::Integer(0600); }, kVTRFileOwnershipDiffers},
      {"a mode missing here is not compared", [](Parts& p) { p.attributes.pop_back(); }, nullptr, kVTRFileSame},
      {"the same number of another kind", nullptr, [](Parts& p) { p.attributes[0].second = Value::Unsigned(501); },
       kVTRFileSame},
      {"dates, sizes, names and protection are ignored",
       [](Parts& p) { p.attributes.emplace_back(kNSFileProtectionKey, Value::String("NSFileProtectionComplete")); },
       [](Parts& p) {
         p.attributes.emplace_back(kNSFileModificationDate, Value::DateValue(Date{5}));
         p.attributes.emplace_back(kNSFileSize, Value::Unsigned(9));
         p.attributes.emplace_back(kNSFileOwnerAccountName, Value::String("other"));
         p.attributes.emplace_back(kNSFileProtectionKey, Value::String(kNSFileProtectionNone));
       },
       kVTRFileSame},
      {"xattr value", nullptr,
       [](Parts& p) {
         p.xattrs = Value::DictionaryOf({{"user.a", DataOf("2")}, {kIgnoredExtendedAttribute, DataOf("u1")}});
       },
       kVTRFileExtendedAttributesDiffer},
      {"xattr count", nullptr,
       [](Parts& p) { p.xattrs = Value::DictionaryOf({{"user.a", DataOf("1")}, {"user.b", DataOf("1")}}); },
       kVTRFileExtendedAttributesDiffer},
      {"xattr name", nullptr, [](Parts& p) { p.xattrs = Value::DictionaryOf({{"user.b", DataOf("1")}}); },
       kVTRFileExtendedAttributesDiffer},
      {"only the ignored xattr differs", nullptr,
       [](Parts& p) { p.xattrs = Value::DictionaryOf({{"user.a", DataOf("1")}}); }, kVTRFileSame},
      {"absent xattrs count as empty", [](Parts& p) { p.xattrs = Value(); },
       [](Parts& p) { p.xattrs = Value::DictionaryOf({{kIgnoredExtendedAttribute, DataOf("u2")}}); }, kVTRFileSame},
  };
  for (const auto& c : cases) {
    Parts mine, theirs;
    if (c.mine) c.mine(mine);
    if (c.theirs) c.theirs(theirs);
    const VTRFileMetadata other = theirs.record();
    EXPECT_EQ(mine.record().compareWith(&other), c.expected) << c.name;
  }
  EXPECT_EQ(Parts().record().compareWith(nullptr), kVTRFileOtherAbsent);
}

}  // namespace
}  // namespace vtr
