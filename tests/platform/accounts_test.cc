#include "platform/accounts.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "tests/support/test_support.h"

namespace vtr {
namespace {

using testing::TempDir;
using testing::WriteFile;

TEST(AccountDatabaseTest, ParsesWellFormedLinesAndSkipsTheRest) {
  const AccountDatabase db = AccountDatabase::Parse(
      "root:x:0:0:root:/root:/bin/sh\n"
      "mobile:*:501:501:Mobile User:/var/mobile:/bin/sh\n"
      "mobile:x:502:502:second entry for the name::\n"  // the first line counts
      "other:x:501:20:second entry for the id::\n"
      "+nisuser:x:600:600:::\n"
      "-nisuser:x:601:601:::\n"
      ":x:700:700:::\n"                // empty name
      "short:x\n"                      // too few fields
      "letters:x:5a:1:::\n"            // not a number
      "negative:x:-5:1:::\n"
      "toolarge:x:4294967295:1:::\n"   // (uid_t)-1 means "no id"
      "largest:x:4294967294:1:::\n"
      "\n"
      "nofinalnewline:x:42:42",
      "wheel:x:0:root\n"
      "mobile:x:501:\n"
      "staff::20\n"  // members field missing: still a group
      "bad:x:\n");

  EXPECT_EQ(db.userId("root"), 0u);
  EXPECT_EQ(db.userId("mobile"), 501u);
  ASSERT_NE(db.userName(501), nullptr);
  EXPECT_EQ(*db.userName(501), "mobile");
  EXPECT_EQ(db.userId("other"), 501u);
  // Each direction takes its own first match, as getpwnam/getpwuid do.
  ASSERT_NE(db.userName(502), nullptr);
  EXPECT_EQ(*db.userName(502), "mobile");
  EXPECT_EQ(db.userId("largest"), 4294967294u);
  EXPECT_EQ(db.userId("nofinalnewline"), 42u);
  for (const char* refused : {"+nisuser", "-nisuser", "nisuser", "", "short", "letters", "negative", "toolarge"}) {
    EXPECT_FALSE(db.userId(refused).has_value()) << refused;
  }
  EXPECT_EQ(db.userName(600), nullptr);
  EXPECT_EQ(db.userName(700), nullptr);

  EXPECT_EQ(db.groupId("wheel"), 0u);
  EXPECT_EQ(db.groupId("mobile"), 501u);
  EXPECT_EQ(db.groupId("staff"), 20u);
  ASSERT_NE(db.groupName(20), nullptr);
  EXPECT_EQ(*db.groupName(20), "staff");
  EXPECT_FALSE(db.groupId("bad").has_value());
  EXPECT_EQ(db.groupName(4242), nullptr);
}

TEST(AccountDatabaseTest, LoadReadsBothFilesAndRefusesWhatIsNotAFile) {
  TempDir dir;
  WriteFile(dir / "passwd", "mobile:x:501:501::/var/mobile:/bin/sh\n");
  WriteFile(dir / "group", "mobile:x:501:\n");
  Result<AccountDatabase> db = AccountDatabase::Load(dir / "passwd", dir / "group");
  ASSERT_TRUE(db.ok()) << db.error().description();
  EXPECT_EQ(db->userId("mobile"), 501u);
  EXPECT_EQ(db->groupId("mobile"), 501u);

  EXPECT_EQ(AccountDatabase::Load(dir / "missing", dir / "group").error().code(), ENOENT);
  EXPECT_EQ(AccountDatabase::Load(dir / "passwd", dir / "missing").error().code(), ENOENT);

  // A fifo must neither block the load nor be read.
  ASSERT_EQ(::mkfifo((dir / "fifo").c_str(), 0600), 0);
  EXPECT_EQ(AccountDatabase::Load(dir / "fifo", dir / "group").error().code(), EINVAL);

  // Oversized: refused from its size alone (the file is sparse).
  {
    const int fd = ::open((dir / "huge").c_str(), O_WRONLY | O_CREAT, 0600);
    ASSERT_GE(fd, 0);
    ASSERT_EQ(::ftruncate(fd, static_cast<off_t>(kMaxAccountFileBytes) + 1), 0);
    ::close(fd);
  }
  EXPECT_EQ(AccountDatabase::Load(dir / "passwd", dir / "huge").error().code(), EFBIG);
}

TEST(AccountDatabaseTest, SharedDatabaseCanBeReplacedAndPutBack) {
  auto installed = std::make_shared<const AccountDatabase>(
      AccountDatabase::Parse("someone:x:4001:4001:::\n", "somegroup:x:4002:\n"));
  AccountDatabase::SetShared(installed);
  std::shared_ptr<const AccountDatabase> shared = AccountDatabase::Shared();
  EXPECT_EQ(shared->userId("someone"), 4001u);
  EXPECT_EQ(shared->groupId("somegroup"), 4002u);

  // A database handed out stays usable after another is installed.
  AccountDatabase::SetShared(nullptr);
  EXPECT_EQ(shared->userId("someone"), 4001u);
  // The default comes from /etc again: root is always there.
  EXPECT_EQ(AccountDatabase::Shared()->userId("root"), 0u);
  EXPECT_FALSE(AccountDatabase::Shared()->userId("someone").has_value());
}

}  // namespace
}  // namespace vtr
