// The file manager's attribute dictionaries: reading them for every kind of
// item, and setting them without ever acting through a symbolic link.
#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "platform/accounts.h"
#include "platform/file_manager.h"
#include "platform/unique_fd.h"
#include "platform/writer_lease.h"
#include "tests/support/file_inspection.h"
#include "tests/support/test_support.h"

namespace vtr {
namespace {

using testing::IsRoot;
using testing::Lstat;
using testing::TempDir;
using testing::WriteFile;

// Installs an account database for the test and puts the default back.
class SharedAccounts {
 public:
  explicit SharedAccounts(const AccountDatabase& db) {
    AccountDatabase::SetShared(std::make_shared<const AccountDatabase>(db));
  }
  ~SharedAccounts() { AccountDatabase::SetShared(nullptr); }
};

// Clears the immutable and append-only flags of a path when the test ends,
// so that the temporary directory can be removed whatever happened.
class FlagsCleanup {
 public:
  explicit FlagsCleanup(std::string path) : path_(std::move(path)) {}
  ~FlagsCleanup() {
    const int fd = ::open(path_.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC);
    if (fd < 0) return;
    int flags = 0;
    if (::ioctl(fd, FS_IOC_GETFLAGS, &flags) == 0) {
      flags &= ~(FS_IMMUTABLE_FL | FS_APPEND_FL);
      ::ioctl(fd, FS_IOC_SETFLAGS, &flags);
    }
    ::close(fd);
  }

 private:
  std::string path_;
};

TEST(AttributesOfItemTest, DescribesEachKindOfItemItself) {
  TempDir dir;
  WriteFile(dir / "file", "12345");
  ASSERT_EQ(::chmod((dir / "file").c_str(), 04751), 0);
  ASSERT_EQ(::link((dir / "file").c_str(), (dir / "second-name").c_str()), 0);
  ASSERT_EQ(::mkdir((dir / "dir").c_str(), 0700), 0);
  ASSERT_EQ(::symlink("file", (dir / "link").c_str()), 0);
  ASSERT_EQ(::symlink("nowhere", (dir / "dangling").c_str()), 0);
  ASSERT_EQ(::mkfifo((dir / "fifo").c_str(), 0600), 0);
  ASSERT_EQ(::mknod((dir / "sock").c_str(), S_IFSOCK | 0600, 0), 0);

  struct Case {
    std::string path;
    const char* type;
    uint64_t size;
  };
  const Case cases[] = {
      {dir / "file", kNSFileTypeRegular, 5},
      {dir / "dir", kNSFileTypeDirectory, static_cast<uint64_t>(Lstat(dir / "dir").st_size)},
      {dir / "link", kNSFileTypeSymbolicLink, 4},       // the link, not the file it names
      {dir / "dangling", kNSFileTypeSymbolicLink, 7},
      {dir / "fifo", kNSFileTypeUnknown, 0},
      {dir / "sock", kNSFileTypeSocket, 0},
      {"/dev/null", kNSFileTypeCharacterSpecial, 0},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.path);
    Result<Value> attributes = AttributesOfItem(c.path);
    ASSERT_TRUE(attributes.ok()) << attributes.error().description();
    const struct stat st = Lstat(c.path);
    EXPECT_EQ(attributes->get(kNSFileType), Value::String(c.type));
    EXPECT_EQ(attributes->get(kNSFileSize).type(), Value::Type::kUnsigned);
    EXPECT_EQ(attributes->get(kNSFileSize), Value::Unsigned(c.size));
    EXPECT_EQ(attributes->get(kNSFilePosixPermissions), Value::Integer(st.st_mode & 07777));
    EXPECT_EQ(attributes->get(kNSFileReferenceCount), Value::Integer(st.st_nlink));
    EXPECT_EQ(attributes->get(kNSFileOwnerAccountID), Value::Integer(st.st_uid));
    EXPECT_EQ(attributes->get(kNSFileGroupOwnerAccountID), Value::Integer(st.st_gid));
    EXPECT_EQ(attributes->get(kNSFileSystemNumber), Value::Integer(static_cast<int64_t>(st.st_dev)));
    EXPECT_EQ(attributes->get(kNSFileSystemFileNumber), Value::Unsigned(st.st_ino));
    EXPECT_EQ(attributes->get(kNSFileModificationDate),
              Value::DateValue(Date::FromUnix(st.st_mtim.tv_sec, st.st_mtim.tv_nsec)));
    EXPECT_EQ(attributes->get(kNSFileCreationDate).type(), Value::Type::kDate);
    EXPECT_EQ(attributes->get(kNSFileExtensionHidden), Value::Boolean(false));
    EXPECT_EQ(attributes->get(kNSFileImmutable), Value::Boolean(false));
    EXPECT_EQ(attributes->get(kNSFileAppendOnly), Value::Boolean(false));
    EXPECT_FALSE(attributes->dictionary()->contains(kNSFileProtectionKey));
    const bool isDevice = S_ISCHR(st.st_mode) || S_ISBLK(st.st_mode);
    EXPECT_EQ(attributes->dictionary()->contains(kNSFileDeviceIdentifier), isDevice);
    if (isDevice) {
      EXPECT_EQ(attributes->get(kNSFileDeviceIdentifier), Value::Integer(static_cast<int64_t>(st.st_rdev)));
    }
  }
  EXPECT_EQ(AttributesOfItem(dir / "file")->get(kNSFileReferenceCount), Value::Integer(2));
  EXPECT_EQ(AttributesOfItem(dir / "missing").error().code(), ENOENT);
}

TEST(AttributesOfItemTest, NamesOnlyIdsTheAccountDatabaseKnows) {
  TempDir dir;
  WriteFile(dir / "file", "");
  const struct stat st = Lstat(dir / "file");
  {
    SharedAccounts accounts(AccountDatabase::Parse("owner:x:" + std::to_string(st.st_uid) + ":0:::\n",
                                                   "group:x:" + std::to_string(st.st_gid) + ":\n"));
    Result<Value> attributes = AttributesOfItem(dir / "file");
    ASSERT_TRUE(attributes.ok());
    EXPECT_EQ(attributes->get(kNSFileOwnerAccountName), Value::String("owner"));
    EXPECT_EQ(attributes->get(kNSFileGroupOwnerAccountName), Value::String("group"));
  }
  SharedAccounts none{AccountDatabase()};
  Result<Value> attributes = AttributesOfItem(dir / "file");
  ASSERT_TRUE(attributes.ok());
  EXPECT_FALSE(attributes->dictionary()->contains(kNSFileOwnerAccountName));
  EXPECT_FALSE(attributes->dictionary()->contains(kNSFileGroupOwnerAccountName));
  EXPECT_TRUE(attributes->dictionary()->contains(kNSFileOwnerAccountID));
}

TEST(SetAttributesTest, SetsModeDateAndOwnerAndPassesOverWhatLinuxCannotSet) {
  TempDir dir;
  WriteFile(dir / "file", "x");
  const Date date = Date::FromUnix(1700000000, 250000000);
  const Dictionary attributes({
      {kNSFilePosixPermissions, Value::Integer(0640)},
      {kNSFileModificationDate, Value::DateValue(date)},
      {kNSFileCreationDate, Value::DateValue(Date::FromUnix(1))},
      {kNSFileBusy, Value::Boolean(true)},
      {kNSFileHFSCreatorCode, Value::Integer(1)},
      {kNSFileHFSTypeCode, Value::Integer(2)},
      {kNSFileExtensionHidden, Value::Boolean(true)},
      {kNSFileProtectionKey, Value::String("NSFileProtectionComplete")},
      {"SomeUnknownKey", Value::String("ignored")},
  });
  Status s = SetAttributes(attributes, dir / "file");
  ASSERT_TRUE(s.ok()) << s.error().description();
  const struct stat st = Lstat(dir / "file");
  EXPECT_EQ(st.st_mode & 07777, 0640u);
  EXPECT_EQ(st.st_mtim.tv_sec, 1700000000);
  EXPECT_NEAR(st.st_mtim.tv_nsec, 250000000, 1000);
  EXPECT_EQ(AttributesOfItem(dir / "file")->get(kNSFileModificationDate), Value::DateValue(date));

  // Only the permission bits count.
  ASSERT_TRUE(SetAttributes(Dictionary({{kNSFilePosixPermissions, Value::Integer(0170755)}}), dir / "file").ok());
  EXPECT_EQ(Lstat(dir / "file").st_mode & 07777, 0755u);

  EXPECT_TRUE(SetAttributes(Dictionary(), dir / "missing").ok()) << "nothing to do touches nothing";
  EXPECT_EQ(SetAttributes(Dictionary({{kNSFilePosixPermissions, Value::Integer(0600)}}), dir / "missing")
                .error()
                .code(),
            ENOENT);
}

TEST(SetAttributesTest, ChecksEveryValueBeforeChangingAnything) {
  TempDir dir;
  WriteFile(dir / "file", "x");
  ASSERT_EQ(::chmod((dir / "file").c_str(), 0600), 0);
  const Value goodMode = Value::Integer(0644);
  const std::pair<const char*, Value> bad[] = {
      {kNSFilePosixPermissions, Value::String("0644")},
      {kNSFilePosixPermissions, Value::Integer(-1)},
      {kNSFileModificationDate, Value::Integer(5)},
      {kNSFileModificationDate, Value::DateValue(Date{1e300})},
      {kNSFileOwnerAccountID, Value::Integer(-1)},
      {kNSFileOwnerAccountID, Value::Unsigned(UINT32_MAX)},
      {kNSFileGroupOwnerAccountID, Value::String("0")},
      {kNSFileOwnerAccountName, Value::Integer(0)},
      {kNSFileOwnerAccountName, Value::String("no-such-user-here")},
      {kNSFileImmutable, Value::String("YES")},
  };
  SharedAccounts accounts{AccountDatabase()};
  for (const auto& [key, value] : bad) {
    SCOPED_TRACE(std::string(key) + " = " + value.description());
    Dictionary attributes = key == std::string(kNSFilePosixPermissions)
                                ? Dictionary({{key, value}})
                                : Dictionary({{key, value}, {kNSFilePosixPermissions, goodMode}});
    Status s = SetAttributes(attributes, dir / "file");
    ASSERT_FALSE(s.ok());
    EXPECT_EQ(s.error().code(), EINVAL);
    EXPECT_EQ(Lstat(dir / "file").st_mode & 07777, 0600u);
  }
}

TEST(SetAttributesTest, NeverActsThroughASymbolicLink) {
  TempDir dir;
  WriteFile(dir / "target", "x");
  ASSERT_EQ(::chmod((dir / "target").c_str(), 0600), 0);
  ASSERT_EQ(::symlink("target", (dir / "link").c_str()), 0);
  const struct stat before = Lstat(dir / "target");

  const Dictionary changes[] = {
      Dictionary({{kNSFilePosixPermissions, Value::Integer(0777)}}),
      Dictionary({{kNSFileModificationDate, Value::DateValue(Date::FromUnix(1000))}}),
      Dictionary({{kNSFileImmutable, Value::Boolean(true)}}),
      Dictionary({{kNSFileOwnerAccountID, Value::Integer(before.st_uid)},
                  {kNSFilePosixPermissions, Value::Integer(0777)}}),
  };
  for (const Dictionary& attributes : changes) {
    SCOPED_TRACE(Value::DictionaryOf(attributes).description());
    Status s = SetAttributes(attributes, dir / "link");
    ASSERT_FALSE(s.ok());
    EXPECT_EQ(s.error().code(), ELOOP);
  }
  const Dictionary ownerOnly({{kNSFileOwnerAccountID, Value::Integer(before.st_uid)}});
  EXPECT_EQ(SetAttributes(ownerOnly, dir / "link", LinkAtPath::kRefuse).error().code(), ELOOP);

  const struct stat after = Lstat(dir / "target");
  EXPECT_EQ(after.st_mode, before.st_mode);
  EXPECT_EQ(after.st_mtim.tv_sec, before.st_mtim.tv_sec);
  EXPECT_EQ(after.st_mtim.tv_nsec, before.st_mtim.tv_nsec);
}

TEST(SetAttributesTest, OwnerByNameOrIdGoesOntoALinkItself) {
  if (!IsRoot()) GTEST_SKIP() << "changing owners needs root";
  TempDir dir;
  WriteFile(dir / "target", "x");
  ASSERT_EQ(::symlink("target", (dir / "link").c_str()), 0);
  SharedAccounts accounts(AccountDatabase::Parse("mobile:x:501:501:::\n", "mobile:x:501:\n"));

  const Dictionary byName({{kNSFileOwnerAccountName, Value::String("mobile")},
                           {kNSFileGroupOwnerAccountName, Value::String("mobile")}});
  ASSERT_TRUE(SetAttributes(byName, dir / "target").ok());
  EXPECT_EQ(Lstat(dir / "target").st_uid, 501u);
  EXPECT_EQ(Lstat(dir / "target").st_gid, 501u);

  // A known name wins over an id; an unknown name falls back to the id.
  const Dictionary both({{kNSFileOwnerAccountName, Value::String("mobile")},
                         {kNSFileOwnerAccountID, Value::Integer(777)},
                         {kNSFileGroupOwnerAccountName, Value::String("nobody-known")},
                         {kNSFileGroupOwnerAccountID, Value::Integer(778)}});
  ASSERT_TRUE(SetAttributes(both, dir / "link").ok());
  EXPECT_EQ(Lstat(dir / "link").st_uid, 501u);
  EXPECT_EQ(Lstat(dir / "link").st_gid, 778u);
  EXPECT_EQ(Lstat(dir / "target").st_gid, 501u) << "the link was followed";
}

TEST(SetAttributesTest, ImmutableFlagIsSetLastAndLiftedForOtherChanges) {
  if (!IsRoot()) GTEST_SKIP() << "the immutable flag needs root";
  TempDir dir;
  WriteFile(dir / "file", "x");
  FlagsCleanup cleanup(dir / "file");
  Status locked = SetAttributes(Dictionary({{kNSFilePosixPermissions, Value::Integer(0600)},
                                            {kNSFileImmutable, Value::Boolean(true)}}),
                                dir / "file");
  if (!locked.ok() && (locked.error().code() == ENOTTY || locked.error().code() == EOPNOTSUPP)) {
    GTEST_SKIP() << "the temporary directory's file system keeps no immutable flag";
  }
  ASSERT_TRUE(locked.ok()) << locked.error().description();
  EXPECT_EQ(AttributesOfItem(dir / "file")->get(kNSFileImmutable), Value::Boolean(true));
  EXPECT_NE(::chmod((dir / "file").c_str(), 0644), 0) << "the flag is not in effect";

  // Restoring the same record again must work on the now immutable file.
  Status again = SetAttributes(Dictionary({{kNSFilePosixPermissions, Value::Integer(0640)},
                                           {kNSFileImmutable, Value::Boolean(true)}}),
                               dir / "file");
  ASSERT_TRUE(again.ok()) << again.error().description();
  EXPECT_EQ(Lstat(dir / "file").st_mode & 07777, 0640u);
  EXPECT_EQ(AttributesOfItem(dir / "file")->get(kNSFileImmutable), Value::Boolean(true));

  ASSERT_TRUE(SetAttributes(Dictionary({{kNSFileImmutable, Value::Boolean(false)}}), dir / "file").ok());
  EXPECT_EQ(AttributesOfItem(dir / "file")->get(kNSFileImmutable), Value::Boolean(false));

  // Devices get no flags: the request would reach the driver.
  ASSERT_EQ(::mknod((dir / "chr").c_str(), S_IFCHR | 0600, ::makedev(1, 3)), 0);
  EXPECT_EQ(SetAttributes(Dictionary({{kNSFileImmutable, Value::Boolean(true)}}), dir / "chr").error().code(),
            EOPNOTSUPP);
}

// A lease is not granted beside a writer, and shows one that comes while it
// is held (the writer waits until it is released).
TEST(WriterLeaseTest, ProvesThatNoOneCanWrite) {
  TempDir dir;
  WriteFile(dir / "f", "x");
  UniqueFd reader(::open((dir / "f").c_str(), O_RDONLY | O_CLOEXEC));
  {
    UniqueFd writer(::open((dir / "f").c_str(), O_RDWR | O_CLOEXEC));
    EXPECT_FALSE(WriterLease(reader.get()).held());
  }
  pid_t child = -1;
  {
    WriterLease lease(reader.get());
    ASSERT_TRUE(lease.held());
    EXPECT_TRUE(lease.stillAlone());
    child = ::fork();
    if (child == 0) _exit(::open((dir / "f").c_str(), O_WRONLY) >= 0 ? 0 : 1);
    bool seen = false;
    for (int i = 0; i < 500 && !seen; ++i) seen = !lease.stillAlone() || ::usleep(10000) != 0;
    EXPECT_TRUE(seen) << "the waiting writer went unseen";
  }
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  EXPECT_EQ(status, 0);
}

}  // namespace
}  // namespace vtr
