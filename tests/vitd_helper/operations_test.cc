// The operations in-process, beneath a directory of the test's own that
// stands as the helper's root: what each command does with paths that a
// compromised client sends, links it plants and entries it swaps.
#include "vitd_helper/operations.h"

#include <fcntl.h>
#include <linux/fs.h>
#include <poll.h>
#include <sys/fsuid.h>
#include <sys/inotify.h>
#include <sys/ioctl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <climits>
#include <cstdlib>
#include <thread>

#include <gtest/gtest.h>

#include "platform/accounts.h"
#include "platform/plist.h"
#include "tests/support/file_inspection.h"
#include "tests/support/test_pki.h"
#include "tests/support/test_support.h"

namespace vtr::testing {
namespace {

constexpr uid_t kMobile = 501;
// A file capability (revision 2, effective): CAP_NET_BIND_SERVICE permitted.
constexpr char kCapability[20] = {0x01, 0, 0, 0x02, 0, 0x04};

std::string ReadLink(const std::string& path) {
  char target[4096];
  const ssize_t n = ::readlink(path.c_str(), target, sizeof target);
  return n < 0 ? std::string() : std::string(target, static_cast<size_t>(n));
}

// A "VmHWM:" or "VmRSS:" figure of this process, in KiB.
long StatusKiB(const std::string& field) {
  const std::string status = ReadFile("/proc/self/status");
  const size_t at = status.find(field);
  return at == std::string::npos ? -1 : std::stol(status.substr(at + field.size()));
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

// A demo tree as the vendor recorded it, the same content as the
// unprivileged daemon lays it down, and a manifest signed over the record.
class RestoreTest : public OperationsTest {
 protected:
  void SetUp() override {
    OperationsTest::SetUp();
    if (!IsRoot()) GTEST_SKIP() << "restores owners: needs root";
    const TestPki& pki = TestPki::Get();
    for (const char* policy : {"production", "test"}) {
      const std::string folder = host(std::string("/usr/share/vitd/anchors/") + policy);
      ASSERT_EQ(std::system(("mkdir -p '" + folder + "' && cp '" + pki.file(policy) + "'/*.pem '" + folder + "'").c_str()), 0);
    }
    // As recorded: root's, with modes, set-id bits, times and attributes.
    const std::string demo = host("/private/var/mobile/Demo");
    ASSERT_EQ(::mkdir(demo.c_str(), 0755), 0);
    ASSERT_EQ(::mkdir((demo + "/d").c_str(), 0750), 0);
    WriteFile(demo + "/d/f", "f");
    ::chmod((demo + "/d/f").c_str(), 0640);
    ASSERT_EQ(::setxattr((demo + "/d/f").c_str(), "user.a", "1", 1, 0), 0);
    ASSERT_EQ(::setxattr((demo + "/d/f").c_str(), "trusted.t", "2", 1, 0), 0);
    const struct timespec old[2] = {{1000000000, 0}, {1000000000, 0}};
    ASSERT_EQ(::utimensat(AT_FDCWD, (demo + "/d/f").c_str(), old, 0), 0);
    WriteFile(demo + "/d/g", "g");
    ::chmod((demo + "/d/g").c_str(), 04755);
    WriteFile(demo + "/d/c", "c");
    ASSERT_EQ(::setxattr((demo + "/d/c").c_str(), "security.capability", kCapability, sizeof kCapability, 0), 0);
    WriteFile(demo + "/d/m", "m");
    ASSERT_EQ(::chown((demo + "/d/m").c_str(), kMobile, kMobile), 0);
    ASSERT_EQ(::symlink("f", (demo + "/d/l").c_str()), 0);
    ASSERT_EQ(::symlink("m", (demo + "/d/ml").c_str()), 0);
    ASSERT_EQ(::lchown((demo + "/d/ml").c_str(), kMobile, kMobile), 0);
    ASSERT_EQ(::utimensat(AT_FDCWD, (demo + "/d").c_str(), old, 0), 0);
    Sign();
    LayDown();
  }

  // Signs the manifest of the demo tree as it stands.
  void Sign() {
    const TestPki& pki = TestPki::Get();
    ASSERT_TRUE(ops_.createDeviceManifest("/private/var/mobile/Demo", true));
    Result<Value> manifest = ReadPropertyListFile(host("/private/var/VTRWorkContainer/DeviceManifest.plist"));
    ASSERT_TRUE(manifest.ok());
    const Value payload = Value::DictionaryOf({
        {"Version", Value::Integer(3)},
        {"Info", Value::String("demo")},
        {"Backup", *manifest},
        {"App", Value::ArrayOf({})},
        {"AppData", Value::DictionaryOf({{"com.demo", Value::DictionaryOf({{"Manifest", *manifest}})}})},
        {"GroupData", Value::DictionaryOf({{"group.demo", *manifest}})},
    });
    const Bytes signedManifest = pki.productionSigned(payload);
    WriteFile(host("/private/var/mobile/m.plist"), std::string(signedManifest.begin(), signedManifest.end()));
  }

  // The content as the daemon lays it: the recorded bytes (mobile's own
  // file's differ), mobile's, plain modes, no attributes.
  void LayDown() {
    const std::string staging = host("/private/var/staging");
    ASSERT_EQ(std::system(("rm -rf '" + staging + "' && mkdir -p '" + staging + "/d'").c_str()), 0);
    for (const char* file : {"f", "g", "c"}) WriteFile(staging + "/d/" + file, file);
    WriteFile(staging + "/d/m", "x");
    ASSERT_EQ(::symlink("f", (staging + "/d/l").c_str()), 0);
    ASSERT_EQ(::symlink("m", (staging + "/d/ml").c_str()), 0);
    ASSERT_EQ(std::system(("chown -hR 501:501 '" + staging + "'").c_str()), 0);
  }

  bool Restore(std::optional<std::string> type = std::nullopt, std::optional<std::string> id = std::nullopt) {
    return ops_.restoreAttributesUnder("/private/var/staging", "/private/var/mobile/m.plist", type, id);
  }
};

TEST_F(RestoreTest, EveryRecordIsLaidOntoTheContent) {
  ASSERT_TRUE(Restore());
  const std::string staging = host("/private/var/staging");
  EXPECT_EQ(Lstat(staging + "/d").st_mode & 07777, 0750u);
  EXPECT_EQ(Lstat(staging + "/d").st_uid, 0u);
  EXPECT_EQ(Lstat(staging + "/d").st_mtim.tv_sec, 1000000000) << "once the copies beneath it are in place";
  const struct stat f = Lstat(staging + "/d/f");
  EXPECT_EQ(f.st_mode & 07777, 0640u);
  EXPECT_EQ(f.st_uid, 0u);
  EXPECT_EQ(f.st_mtim.tv_sec, 1000000000);
  EXPECT_EQ(Xattr(staging + "/d/f", "user.a"), "1");
  EXPECT_EQ(Xattr(staging + "/d/f", "trusted.t"), "2");
  EXPECT_EQ(Lstat(staging + "/d/g").st_mode & 07777, 04755u) << "set-id bits survive the change of owner";
  EXPECT_EQ(Lstat(staging + "/d/m").st_uid, kMobile);
  EXPECT_EQ(Lstat(staging + "/d/l").st_uid, 0u) << "a link gets its own owner";
  EXPECT_EQ(Xattr(staging + "/d/c", "security.capability"), std::string(kCapability, sizeof kCapability));
  EXPECT_EQ(Lstat(staging).st_mode & 07777, 0755u) << "the tree itself is the record \"/\"";
}

TEST_F(RestoreTest, TheContainerTypeAndIdentifierChooseTheManifest) {
  const struct {
    std::optional<std::string> type;
    std::optional<std::string> id;
    bool restored;
    const char* message;
  } cases[] = {
      {"AppData", "com.demo", true, nullptr},
      {"GroupData", "group.demo", true, nullptr},
      {"AppData", std::nullopt, true, nullptr},
      {std::nullopt, "anything", true, nullptr},
      {"AppData", "nope", false, "Couldn't load container data for AppData/nope"},
      {"GroupData", "nope", false, "Couldn't load manifest dict for GroupData/nope"},
      {"ExtensionData", "com.demo", false, "Couldn't load manifest dict for ExtensionData/com.demo"},
      {"appdata", "com.demo", false, "Couldn't load manifest dict for appdata/com.demo"},
  };
  for (const auto& c : cases) {
    LayDown();
    LogCapture log;
    EXPECT_EQ(Restore(c.type, c.id), c.restored) << c.type.value_or("nil") << "/" << c.id.value_or("nil");
    if (c.message != nullptr) {
      EXPECT_EQ(log.messages().back(), c.message);
      EXPECT_EQ(Lstat(host("/private/var/staging/d/f")).st_uid, kMobile) << "nothing restored";
    }
  }
}

TEST_F(RestoreTest, NothingOutsideTheStagingRootChangesThroughWhatTheClientPlanted) {
  // A link where a directory was recorded, pointing outside.
  ASSERT_EQ(std::system(("rm -rf '" + host("/private/var/staging/d") + "'").c_str()), 0);
  ASSERT_EQ(::symlink(host("/etc").c_str(), host("/private/var/staging/d").c_str()), 0);
  LogCapture log;
  EXPECT_FALSE(Restore());
  ASSERT_FALSE(log.messages().empty());
  EXPECT_EQ(log.messages().back().rfind("Could not set file attributs at /private/var/staging/d with error - ", 0), 0u)
      << log.messages().back();
  // A record beneath it is never reached through the link either.
  ASSERT_EQ(::unlink(host("/private/var/staging/d").c_str()), 0);
  ASSERT_EQ(::mkdir(host("/private/var/staging/real").c_str(), 0755), 0);
  ASSERT_EQ(::symlink("real", host("/private/var/staging/d").c_str()), 0);
  log.clear();
  EXPECT_FALSE(Restore());
  EXPECT_EQ(Lstat(host("/private/var/staging/real")).st_mode & 07777, 0755u);
  // A root file of the area linked in where mobile's file was recorded: it
  // is never given to mobile.
  LayDown();
  WriteFile(host("/private/var/dbfile"), "secret");
  ::chmod(host("/private/var/dbfile").c_str(), 0600);
  ASSERT_EQ(::unlink(host("/private/var/staging/d/m").c_str()), 0);
  ASSERT_EQ(::link(host("/private/var/dbfile").c_str(), host("/private/var/staging/d/m").c_str()), 0);
  EXPECT_FALSE(Restore());
  EXPECT_EQ(Lstat(host("/private/var/dbfile")).st_uid, 0u);
  // The same where mobile's link was recorded: only a link takes a link
  // record.
  LayDown();
  ASSERT_EQ(::unlink(host("/private/var/staging/d/ml").c_str()), 0);
  ASSERT_EQ(::link(host("/private/var/dbfile").c_str(), host("/private/var/staging/d/ml").c_str()), 0);
  EXPECT_FALSE(Restore());
  EXPECT_EQ(Lstat(host("/private/var/dbfile")).st_uid, 0u);
  // Paths the client sends are client paths.
  EXPECT_FALSE(ops_.restoreAttributesUnder("/etc", "/private/var/mobile/m.plist", std::nullopt, std::nullopt));
  EXPECT_FALSE(ops_.restoreAttributesUnder("/private/var/staging", "/private/var/root/m.plist", std::nullopt, std::nullopt));
}

TEST_F(RestoreTest, PrivilegeGoesOnlyToTheSignedContentOnAnInodeNobodyElseHolds) {
  const std::string staging = host("/private/var/staging");
  // Mobile's own bytes where a set-uid file or a file capability was
  // signed: refused, the file left mobile's.
  const struct {
    const char* file;
    const char* content;
    const char* why;
  } swapped[] = {
      {"g", "#", "its content does not hash to the record's"},
      {"g", "#!/bin/sh\nexec /bin/sh -p\n", "its size is not the record's"},
      {"c", "#", "its content does not hash to the record's"},
  };
  for (const auto& c : swapped) {
    LayDown();
    const std::string path = staging + "/d/" + c.file;
    WriteFile(path, c.content);
    LogCapture log;
    EXPECT_FALSE(Restore()) << c.file << " " << c.content;
    const std::string line = std::string("Not granting privilege to /private/var/staging/d/") + c.file + ": " + c.why;
    EXPECT_NE(std::find(log.messages().begin(), log.messages().end(), line), log.messages().end()) << line;
    EXPECT_EQ(Lstat(path).st_uid, kMobile);
    EXPECT_EQ(Lstat(path).st_mode & 06000, 0u);
    EXPECT_EQ(Xattr(path, "security.capability"), "<none>");
  }
  // The signed bytes, with a writable descriptor, a shared writable mapping
  // and a second link that mobile keeps: none reaches the restored file.
  LayDown();
  // Mobile's access lists too: one on a file granted in place, a default
  // one on the folder a copy is made in.
  const std::string acl = {2, 0, 0, 0, 1, 0, 6, 0, -1, -1, -1, -1, 2, 0, 6, 0, -11, 1, 0, 0,
                           4, 0, 4, 0, -1, -1, -1, -1, 16, 0, 6, 0, -1, -1, -1, -1, 32, 0, 4, 0, -1, -1, -1, -1};
  ASSERT_EQ(::setxattr((staging + "/d/f").c_str(), "system.posix_acl_access", acl.data(), acl.size(), 0), 0);
  ASSERT_EQ(::setxattr((staging + "/d").c_str(), "system.posix_acl_default", acl.data(), acl.size(), 0), 0);
  const std::string g = staging + "/d/g";
  const std::string kept = host("/private/var/mobile/kept");
  ASSERT_EQ(::link(g.c_str(), kept.c_str()), 0);
  UniqueFd writable(::open(g.c_str(), O_RDWR | O_CLOEXEC));
  void* mapped = ::mmap(nullptr, 1, PROT_READ | PROT_WRITE, MAP_SHARED, writable.get(), 0);
  ASSERT_NE(mapped, MAP_FAILED);
  ASSERT_TRUE(Restore());
  ASSERT_EQ(::pwrite(writable.get(), "w", 1, 0), 1);
  static_cast<char*>(mapped)[0] = 'm';
  ::munmap(mapped, 1);
  EXPECT_EQ(ReadFile(g), "g");
  const struct stat restored = Lstat(g);
  EXPECT_EQ(restored.st_mode & 07777, 04755u);
  EXPECT_EQ(restored.st_nlink, 1u);
  for (const char* file : {"f", "g"}) EXPECT_EQ(Xattr(staging + "/d/" + file, "system.posix_acl_access"), "<none>") << file;
  EXPECT_EQ(Xattr(staging + "/d", "system.posix_acl_default"), "<none>") << "root's folder";
  EXPECT_EQ(Lstat(staging + "/d").st_mtim.tv_sec, 1000000000) << "once the copy beneath it is in place";
  EXPECT_EQ(Lstat(kept).st_uid, kMobile);
  EXPECT_EQ(Lstat(kept).st_mode & 06000, 0u);
}

TEST_F(RestoreTest, WhatIsLaidIntoAFolderCannotBeSwappedByMobile) {
  // A folder whose record closes a batch of records and whose file opens
  // the next: the file is laid only once its folder is root's, so that
  // mobile, told by inotify when the file was restored, cannot rename its
  // own over it.
  const std::string demo = host("/private/var/mobile/Demo");
  ASSERT_EQ(::mkdir((demo + "/a").c_str(), 0755), 0);
  for (int i = 0; i < 61; ++i) WriteFile(demo + "/a/f" + std::to_string(100 + i), std::string(1 << 18, 'a'));
  ASSERT_EQ(::mkdir((demo + "/b").c_str(), 0755), 0);
  WriteFile(demo + "/b/x", "x");
  Sign();
  const std::string staging = host("/private/var/staging");
  ASSERT_EQ(std::system(("cp -a '" + demo + "/a' '" + demo + "/b' '" + staging + "/' && echo mine > '" + staging +
                         "/b/mine' && chown -R 501:501 '" + staging + "'").c_str()), 0);
  const int watch = ::inotify_init1(IN_CLOEXEC);
  ASSERT_GE(::inotify_add_watch(watch, (staging + "/b/x").c_str(), IN_ATTRIB), 0);
  const UniqueFd folder(::open((staging + "/b").c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));  // mobile's place
  std::thread mobile([&] {
    char event[sizeof(struct inotify_event) + NAME_MAX + 1];
    struct pollfd ready = {watch, POLLIN, 0};
    if (::poll(&ready, 1, 20000) != 1 || ::read(watch, event, sizeof event) <= 0) return;
    (void)::setfsuid(kMobile);  // this thread only, and without root's file capabilities
    (void)::renameat(folder.get(), "mine", folder.get(), "x");
  });
  EXPECT_TRUE(Restore());
  ::close(watch);
  mobile.join();
  EXPECT_EQ(Lstat(staging + "/b/x").st_uid, 0u);
  EXPECT_EQ(ReadFile(staging + "/b/x"), "x");
}

TEST_F(RestoreTest, AManifestFileIsReadWithinItsSizeAndTheLimit) {
  // A sparse file of 1 TiB, a binary one just over its limit, an XML one
  // just over its own, a fifo: refused before anything is read, so the
  // peak memory stays where it was.
  const std::string big = host("/private/var/mobile/big.plist");
  const struct {
    const char* start;  // nullptr: a fifo
    off_t size;
  } cases[] = {
      {"bplist00", off_t{1} << 40},
      {"bplist00", (off_t{44} << 20) + 1},
      {"<?xml", (off_t{12} << 20) + 1},
      {nullptr, 0},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(::testing::Message() << (c.start != nullptr ? c.start : "fifo") << " " << c.size);
    ::unlink(big.c_str());
    if (c.start != nullptr) {
      WriteFile(big, c.start);
      ASSERT_EQ(::truncate(big.c_str(), c.size), 0);
    } else {
      ASSERT_EQ(::mkfifo(big.c_str(), 0644), 0);
    }
    WriteFile("/proc/self/clear_refs", "5");  // the peak starts again from here
    const long before = StatusKiB("VmRSS:");
    LogCapture log;
    EXPECT_FALSE(ops_.restoreAttributesUnder("/private/var/staging", "/private/var/mobile/big.plist", std::nullopt,
                                             std::nullopt));
    EXPECT_EQ(log.messages().back(), "Cannot open manifest file.");
    EXPECT_LT(StatusKiB("VmHWM:") - before, 8 * 1024);
  }
}

TEST_F(RestoreTest, AManifestThatFailsItsCheckRestoresNothing) {
  std::string bytes = ReadFile(host("/private/var/mobile/m.plist"));
  bytes[bytes.size() / 2] ^= 1;
  WriteFile(host("/private/var/mobile/m.plist"), bytes);
  EXPECT_FALSE(Restore());
  EXPECT_EQ(Lstat(host("/private/var/staging/d/f")).st_uid, kMobile);
  LogCapture log;
  EXPECT_FALSE(ops_.restoreAttributesUnder("/private/var/staging", "/private/var/mobile/none.plist", std::nullopt,
                                           std::nullopt));
  EXPECT_EQ(log.messages().back(), "Cannot open manifest file.");
}

}  // namespace
}  // namespace vtr::testing
