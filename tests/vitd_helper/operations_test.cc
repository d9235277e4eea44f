// The operations in-process, beneath a directory of the test's own that
// stands as the helper's root: what each command does with paths that a
// compromised client sends, links it plants and entries it swaps.
#include "vitd_helper/operations.h"

#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "platform/accounts.h"
#include "platform/plist.h"
#include "tests/support/file_inspection.h"
#include "tests/support/test_support.h"

namespace vtr::testing {
namespace {

constexpr uid_t kMobile = 501;

std::string ReadLink(const std::string& path) {
  char target[4096];
  const ssize_t n = ::readlink(path.c_str(), target, sizeof target);
  return n < 0 ? std::string() : std::string(target, static_cast<size_t>(n));
}

class OperationsTest : public ::testing::Test {
 protected:
  void SetUp() override {
    for (const char* d : {"etc", "private", "private/var", "private/var/root", "private/var/root/Library",
                          "private/var/root/Library/Preferences", "private/var/mobile", "private/var/mobile/Library",
                          "private/var/mobile/Library/Preferences", "private/var/logs", "private/var/logs/vitd",
                          "private/var/VTRWorkContainer"}) {
      ASSERT_EQ(::mkdir((root_ / d).c_str(), 0755), 0) << d;
    }
    WriteFile(root_ / "etc/passwd", "root:x:0:0::/:/bin/sh\n");
    ::chmod((root_ / "etc/passwd").c_str(), 0644);
    WriteFile(root_ / "private/var/root/secret", "s");
    // The links a client plants: to a folder outside, and to a closed one.
    ASSERT_EQ(::symlink((root_ / "etc").c_str(), (root_ / "private/var/mobile/out").c_str()), 0);
    ASSERT_EQ(::symlink("../root", (root_ / "private/var/mobile/home").c_str()), 0);
    accounts_ = AccountDatabase::Shared();
    AccountDatabase::SetShared(std::make_shared<const AccountDatabase>(
        AccountDatabase::Parse("root:x:0:0::/:/bin/sh\nmobile:x:501:501::/:/bin/sh\n", "root:x:0:\nmobile:x:501:\n")));
  }
  void TearDown() override {
    AccountDatabase::SetShared(accounts_);
    // Nothing outside the areas changed, whatever the test sent.
    EXPECT_EQ(Lstat(root_ / "etc").st_mode & 07777, 0755u);
    EXPECT_EQ(Lstat(root_ / "etc/passwd").st_mode & 07777, 0644u);
    EXPECT_EQ(ReadFile(root_ / "private/var/root/secret"), "s");
    EXPECT_EQ(Lstat(root_ / "private/var/root").st_mode & 07777, 0755u);
    EXPECT_EQ(Lstat(root_ / "private/var/logs/vitd").st_mode & 07777, 0755u);
  }

  VTRHOperations makeOperations() {
    auto rootFd = std::make_shared<const UniqueFd>(::open(root_.path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    return VTRHOperations(HelperPaths(), ClientPathResolver(ClientAreas::Defaults(), std::move(rootFd)));
  }
  std::string host(const std::string& inside) const { return root_.path() + inside; }
  bool refused(const LogCapture& log) const {
    for (const std::string& m : log.messages()) {
      if (m.rfind("Refused path ", 0) == 0) return true;
    }
    return false;
  }

  TempDir root_;
  VTRHOperations ops_ = makeOperations();
  std::shared_ptr<const AccountDatabase> accounts_;
};

TEST_F(OperationsTest, PathsOutsideTheAreasInClosedTreesOrThroughLinksAreRefused) {
  // Each path is refused by every command that changes what it names.
  for (const char* path : {"/etc/passwd", "/etc", "/private/var/../../etc", "relative/x", "", "/private/var",
                           "/var/", "/private/var/root/x", "/var/root", "/private/var/logs", "/private/var/logs/vitd",
                           "/private/var/mobile/out/x", "/private/var/mobile/home/secret"}) {
    SCOPED_TRACE(path);
    LogCapture log;
    EXPECT_FALSE(ops_.prepareDirectory(path, true));
    EXPECT_TRUE(refused(log));
    EXPECT_FALSE(ops_.prepareLogContainer(path));
    EXPECT_FALSE(ops_.createHardLinks(path, "/private/var/mobile/copy"));
    EXPECT_FALSE(ops_.createHardLinks("/private/var/mobile/Library", path));
    EXPECT_FALSE(ops_.moveStagingToFinal(path));
    EXPECT_FALSE(ops_.removeDirectory(path));
  }
  EXPECT_FALSE(Exists(host("/private/var/mobile/copy")));
  EXPECT_FALSE(Exists(host("/private/var/backup")));
}

TEST_F(OperationsTest, ALinkAtTheEndIsNeverFollowedTrailingSlashOrNot) {
  for (const char* path : {"/private/var/mobile/out", "/private/var/mobile/out/", "/var/mobile/home/"}) {
    SCOPED_TRACE(path);
    const std::string link = host(std::string(path).find("home") != std::string::npos ? "/private/var/mobile/home"
                                                                                       : "/private/var/mobile/out");
    EXPECT_FALSE(ops_.prepareDirectory(path, true));
    EXPECT_FALSE(ops_.prepareLogContainer(path));
    EXPECT_FALSE(ops_.moveStagingToFinal(path));
    // Linked, the link is copied as a link; removed, the link goes itself.
    EXPECT_TRUE(ops_.createHardLinks(path, "/private/var/mobile/copy"));
    EXPECT_TRUE(S_ISLNK(Lstat(host("/private/var/mobile/copy")).st_mode));
    ASSERT_EQ(::unlink(host("/private/var/mobile/copy").c_str()), 0);
    const std::string target = ReadLink(link);
    EXPECT_TRUE(ops_.removeDirectory(path));
    EXPECT_FALSE(Exists(link));
    ASSERT_EQ(::symlink(target.c_str(), link.c_str()), 0);
  }
}

TEST_F(OperationsTest, PrepareDirectoryCreatesOpensAndEmptiesOnlyWhatItWasGiven) {
  const std::string d = host("/private/var/mobile/d");
  ASSERT_EQ(::mkdir(d.c_str(), 0700), 0);
  ASSERT_EQ(::mkdir((d + "/VTR_staging").c_str(), 0700), 0);
  EXPECT_TRUE(ops_.prepareDirectory("/private/var/mobile/d", false));
  EXPECT_EQ(Lstat(d).st_mode & 07777, 0700u);
  EXPECT_FALSE(Exists(d + "/VTR_staging"));
  ASSERT_EQ(::chmod(d.c_str(), 04750), 0);
  EXPECT_TRUE(ops_.prepareDirectory("/var/mobile/d/", true));
  EXPECT_EQ(Lstat(d).st_mode & 07777, 04777u);
  EXPECT_TRUE(ops_.prepareDirectory("/var/mobile/new/deeper", true));
  EXPECT_TRUE(IsDirectory(host("/private/var/mobile/new/deeper")));
  // A staging folder that is a link goes as a link; its target stays.
  ASSERT_EQ(::symlink((root_ / "etc").c_str(), (d + "/VTR_staging").c_str()), 0);
  EXPECT_TRUE(ops_.prepareDirectory("/private/var/mobile/d", false));
  EXPECT_FALSE(Exists(d + "/VTR_staging"));
  // Something not a directory is not prepared, and not opened to others.
  WriteFile(host("/private/var/mobile/file"), "x");
  ::chmod(host("/private/var/mobile/file").c_str(), 0600);
  LogCapture log;
  EXPECT_FALSE(ops_.prepareDirectory("/private/var/mobile/file", true));
  EXPECT_TRUE(refused(log));
  EXPECT_EQ(Lstat(host("/private/var/mobile/file")).st_mode & 07777, 0600u);
}

TEST_F(OperationsTest, AStagingFolderThatCannotGoSaysWhy) {
  if (!IsRoot()) GTEST_SKIP() << "an immutable file: needs root";
  const std::string staging = host("/private/var/mobile/d/VTR_staging");
  ASSERT_EQ(::mkdir(host("/private/var/mobile/d").c_str(), 0755), 0);
  ASSERT_EQ(::mkdir(staging.c_str(), 0755), 0);
  WriteFile(staging + "/pinned", "x");
  UniqueFd pinned(::open((staging + "/pinned").c_str(), O_RDONLY | O_CLOEXEC));
  int flags = 0;
  if (::ioctl(pinned.get(), FS_IOC_GETFLAGS, &flags) != 0) GTEST_SKIP() << "no file flags here";
  flags |= FS_IMMUTABLE_FL;
  ASSERT_EQ(::ioctl(pinned.get(), FS_IOC_SETFLAGS, &flags), 0);
  LogCapture log;
  EXPECT_FALSE(ops_.prepareDirectory("/private/var/mobile/d", false));
  flags &= ~FS_IMMUTABLE_FL;
  ASSERT_EQ(::ioctl(pinned.get(), FS_IOC_SETFLAGS, &flags), 0);
  EXPECT_EQ(log.messages(), std::vector<std::string>{
                                "-[VTRHOperations prepareDirectory:writableByMobile:]: Could not remove the path "
                                "/private/var/mobile/d/VTR_staging with error - /private/var/mobile/d/VTR_staging/pinned: "
                                "Operation not permitted(0x1)"});
}

TEST_F(OperationsTest, LogContainerHandsOverOnlyFilesWithOneLinkAndDirectories) {
  if (!IsRoot()) GTEST_SKIP() << "hands entries to another user: needs root";
  const std::string d = host("/private/var/logs/demo");
  ASSERT_EQ(::mkdir(d.c_str(), 0755), 0);
  WriteFile(d + "/vitd-own.log", "x");
  ASSERT_EQ(::mkdir((d + "/vitd-dir").c_str(), 0755), 0);
  ASSERT_EQ(::link(host("/private/var/root/secret").c_str(), (d + "/vitd-linked.log").c_str()), 0);
  ASSERT_EQ(::symlink(host("/etc/passwd").c_str(), (d + "/vitd-symlink").c_str()), 0);
  ASSERT_EQ(::mkfifo((d + "/vitd-fifo").c_str(), 0644), 0);
  EXPECT_TRUE(ops_.prepareLogContainer("/var/logs/demo"));
  EXPECT_EQ(Lstat(d + "/vitd-own.log").st_uid, kMobile);
  EXPECT_EQ(Lstat(d + "/vitd-dir").st_uid, kMobile);
  for (const char* kept : {"/vitd-linked.log", "/vitd-symlink", "/vitd-fifo"}) {
    EXPECT_EQ(Lstat(d + kept).st_uid, 0u) << kept;
  }
  EXPECT_EQ(Lstat(host("/private/var/root/secret")).st_uid, 0u);
  EXPECT_EQ(Lstat(host("/etc/passwd")).st_uid, 0u);
}

TEST_F(OperationsTest, PreferencesMoveOnlyBetweenRealFoldersAndOnlyAFileOfItsOwn) {
  if (!IsRoot()) GTEST_SKIP() << "hands the file to another user: needs root";
  const std::string source = host("/private/var/root/Library/Preferences/com.orvane.Vitrell.plist");
  const std::string target = host("/private/var/mobile/Library/Preferences/com.orvane.Vitrell.plist");
  // mobile's folder replaced by a link to a folder outside: nothing lands there.
  const std::string folder = host("/private/var/mobile/Library/Preferences");
  ASSERT_EQ(::rmdir(folder.c_str()), 0);
  ASSERT_EQ(::symlink(host("/etc").c_str(), folder.c_str()), 0);
  WriteFile(source, "prefs");
  LogCapture log;
  EXPECT_FALSE(ops_.migratePreferencesFile());
  EXPECT_TRUE(refused(log));
  EXPECT_FALSE(Exists(host("/etc/com.orvane.Vitrell.plist")));
  EXPECT_TRUE(Exists(source));
  ASSERT_EQ(::unlink(folder.c_str()), 0);
  ASSERT_EQ(::mkdir(folder.c_str(), 0755), 0);
  // A source with a second link elsewhere is not handed over.
  ASSERT_EQ(::link(source.c_str(), host("/private/var/root/twin").c_str()), 0);
  EXPECT_FALSE(ops_.migratePreferencesFile());
  EXPECT_FALSE(Exists(target));
  ASSERT_EQ(::unlink(host("/private/var/root/twin").c_str()), 0);
  EXPECT_TRUE(ops_.migratePreferencesFile());
  EXPECT_EQ(Lstat(target).st_uid, kMobile);
  EXPECT_FALSE(Exists(source));
}

TEST_F(OperationsTest, HardLinksStayInsideTheirTreesAndStagingMovesOnlyARealDirectory) {
  const std::string media = host("/private/var/mobile/Media");
  ASSERT_EQ(::mkdir(media.c_str(), 0755), 0);
  WriteFile(media + "/a", "a");
  ASSERT_EQ(::symlink(host("/etc").c_str(), (media + "/escape").c_str()), 0);
  LogCapture log;
  EXPECT_FALSE(ops_.createHardLinks("/private/var/mobile/Media", "/private/var/mobile/Media/inner"));
  EXPECT_TRUE(refused(log));
  EXPECT_TRUE(ops_.createHardLinks("/private/var/mobile/Media", "/private/var/staging"));
  EXPECT_EQ(Lstat(host("/private/var/staging/a")).st_ino, Lstat(media + "/a").st_ino);
  EXPECT_TRUE(S_ISLNK(Lstat(host("/private/var/staging/escape")).st_mode));  // recreated, not followed
  EXPECT_FALSE(Exists(host("/private/var/staging/escape/passwd")) &&
               Lstat(host("/private/var/staging/escape/passwd")).st_ino != Lstat(host("/etc/passwd")).st_ino);

  // A link to a directory is no staging directory.
  ASSERT_EQ(::symlink(host("/private/var/staging").c_str(), host("/private/var/mobile/stage-link").c_str()), 0);
  log.clear();
  EXPECT_FALSE(ops_.moveStagingToFinal("/private/var/mobile/stage-link"));
  EXPECT_TRUE(log.contains("Staging path /private/var/mobile/stage-link looks wrong."));
  EXPECT_FALSE(Exists(host("/private/var/backup")));
  ASSERT_EQ(::mkdir(host("/private/var/backup").c_str(), 0755), 0);
  WriteFile(host("/private/var/backup/old"), "old");
  EXPECT_TRUE(ops_.moveStagingToFinal("/private/var/staging/"));
  EXPECT_EQ(ReadFile(host("/private/var/backup/a")), "a");
  EXPECT_FALSE(Exists(host("/private/var/backup/old")));
  EXPECT_FALSE(Exists(host("/private/var/staging")));
}

TEST_F(OperationsTest, ManifestsNeverRecordClosedTreesAndKeyATrailingSlashRootAsSlash) {
  WriteFile(host("/private/var/mobile/Library/f"), "f");
  WriteFile(host("/private/var/logs/vitd/vitd_helper.log"), "log");
  const std::string manifestPath = host("/private/var/VTRWorkContainer/DeviceManifest.plist");
  LogCapture log;
  EXPECT_FALSE(ops_.createDeviceManifest("/private/var/root", false));
  EXPECT_TRUE(refused(log));
  EXPECT_FALSE(Exists(manifestPath));
  // A link to a closed tree is not entered: the tree cannot be walked.
  EXPECT_TRUE(ops_.createDeviceManifest("/private/var/mobile/home/", true));
  Result<Value> linked = ReadPropertyListFile(manifestPath);
  ASSERT_TRUE(linked.ok());
  EXPECT_TRUE(linked->get("/secret").isNil());

  EXPECT_TRUE(ops_.createDeviceManifest("/private/var/", false));
  Result<Value> whole = ReadPropertyListFile(manifestPath);
  ASSERT_TRUE(whole.ok());
  EXPECT_TRUE(whole->get("/var/mobile/Library/f").dictionary());
  EXPECT_TRUE(whole->get("/var/logs").dictionary());
  for (const char* closed : {"/var/root", "/var/root/secret", "/var/logs/vitd", "/var/logs/vitd/vitd_helper.log"}) {
    EXPECT_TRUE(whole->get(closed).isNil()) << closed;
  }

  EXPECT_TRUE(ops_.createDeviceManifest("/var/logs/", true));
  Result<Value> logs = ReadPropertyListFile(manifestPath);
  ASSERT_TRUE(logs.ok());
  EXPECT_TRUE(logs->get("/").dictionary()) << "the root record of a trailing-slash tree";
  EXPECT_TRUE(logs->get("vitd").isNil());
  EXPECT_EQ(logs->dictionary()->size(), 1u);
}

}  // namespace
}  // namespace vtr::testing
