// The preferences and container commands, end to end in a sandbox root.
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "tests/support/file_inspection.h"
#include "tests/support/test_support.h"
#include "tests/vitd_helper/helper_sandbox.h"

namespace vtr::testing {
namespace {

class ContainersTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (!IsRoot()) GTEST_SKIP() << "the helper chroots into its sandbox root: needs root";
    ASSERT_TRUE(sandbox_.start()) << sandbox_.log();
  }

  // Sends one command and returns its "Response" (nullopt when none came).
  std::optional<bool> command(const std::string& key, XpcObject parameter) {
    std::vector<XpcObject> replies = sandbox_.request(XpcObject::Dictionary({{key, std::move(parameter)}}), 1);
    if (replies.size() != 1 || replies[0].find("Response") == nullptr) return std::nullopt;
    return replies[0].find("Response")->boolValue();
  }
  std::optional<bool> command(const std::string& key, const std::string& path) {
    return command(key, XpcObject::String(path));
  }

  HelperSandbox sandbox_;
};

TEST_F(ContainersTest, LogContainerPathsAreCheckedByPlainPrefix) {
  EXPECT_EQ(command("prepareLogContainer:", "/private/var/logsfoo"), true);
  EXPECT_TRUE(S_ISDIR(Lstat(sandbox_.host("/private/var/logsfoo")).st_mode));
  EXPECT_EQ(command("prepareLogContainer:", "/var/logs/demo"), true);
  EXPECT_TRUE(S_ISDIR(Lstat(sandbox_.host("/private/var/logs/demo")).st_mode));

  EXPECT_EQ(command("prepareLogContainer:", "/tmp/private/var/logs"), false);
  EXPECT_FALSE(Exists(sandbox_.host("/tmp")));
  EXPECT_TRUE(sandbox_.logged(
      "-[VTRHMessageResponder prepareLogContainer:]: creating logs under /tmp/private/var/logs is not allowed."));
  EXPECT_EQ(command("prepareLogContainer:", XpcObject::Bool(true)), false);
}

TEST_F(ContainersTest, LogContainerHandsItsVitdEntriesToMobile) {
  const std::string dir = sandbox_.host("/private/var/logs/d");
  ASSERT_EQ(::mkdir(dir.c_str(), 0700), 0);
  WriteFile(dir + "/vitd-1.log", "x");
  WriteFile(dir + "/x-vitd-1.log", "x");
  ASSERT_EQ(::mkdir((dir + "/vitd-dir").c_str(), 0700), 0);
  ASSERT_EQ(::mkdir((dir + "/VTR_staging").c_str(), 0700), 0);
  WriteFile(dir + "/VTR_staging/inner", "x");

  EXPECT_EQ(command("prepareLogContainer:", "/private/var/logs/d"), true);
  EXPECT_EQ(Lstat(dir).st_mode & 07777, 0777u);
  for (const char* name : {"/vitd-1.log", "/vitd-dir"}) {
    EXPECT_EQ(Lstat(dir + name).st_uid, kMobileUid) << name;
    EXPECT_EQ(Lstat(dir + name).st_gid, kMobileGid) << name;
  }
  EXPECT_EQ(Lstat(dir + "/x-vitd-1.log").st_uid, 0u);
  EXPECT_FALSE(Exists(dir + "/VTR_staging"));
  EXPECT_EQ(Lstat(dir).st_uid, 0u);  // the directory itself keeps its owner
}

TEST_F(ContainersTest, WorkContainerOpensPermissionsAndKeepsSpecialBits) {
  const struct {
    mode_t before;
    mode_t after;
  } cases[] = {{0700, 0777}, {04750, 04777}, {0755, 0777}, {02700, 02777}, {0777, 0777}};
  int n = 0;
  for (const auto& c : cases) {
    const std::string inside = "/private/var/work" + std::to_string(n++);
    const std::string dir = sandbox_.host(inside);
    ASSERT_EQ(::mkdir(dir.c_str(), 0700), 0);
    ASSERT_EQ(::chmod(dir.c_str(), c.before), 0);
    EXPECT_EQ(command("prepareWorkContainer:", inside), true);
    EXPECT_EQ(Lstat(dir).st_mode & 07777, c.after) << std::oct << c.before;
  }
}

TEST_F(ContainersTest, WorkContainerIsCreatedAndItsStagingFolderRemovedWhole) {
  EXPECT_EQ(command("prepareWorkContainer:", "/private/var/VTRWorkContainer/deep/er"), true);
  EXPECT_TRUE(S_ISDIR(Lstat(sandbox_.host("/private/var/VTRWorkContainer/deep/er")).st_mode));

  const std::string work = sandbox_.host("/private/var/VTRWorkContainer");
  ASSERT_EQ(::mkdir((work + "/VTR_staging").c_str(), 0755), 0);
  ASSERT_EQ(::mkdir((work + "/VTR_staging/sub").c_str(), 0755), 0);
  WriteFile(work + "/VTR_staging/sub/file", "content");
  WriteFile(work + "/keep", "content");
  EXPECT_EQ(command("prepareWorkContainer:", "/private/var/VTRWorkContainer"), true);
  EXPECT_FALSE(Exists(work + "/VTR_staging"));
  EXPECT_TRUE(Exists(work + "/keep"));

  // A work container that is a symbolic link gets no permission change
  // through it.
  const std::string target = sandbox_.host("/private/var/target");
  ASSERT_EQ(::mkdir(target.c_str(), 0700), 0);
  ASSERT_EQ(::symlink("target", sandbox_.host("/private/var/link").c_str()), 0);
  EXPECT_EQ(command("prepareWorkContainer:", "/private/var/link"), false);
  EXPECT_EQ(Lstat(target).st_mode & 07777, 0700u);
}

TEST_F(ContainersTest, RemoveWorkContainerNeverFollowsLinks) {
  EXPECT_EQ(command("removeWorkContainer:", "/private/var/missing"), true);

  TempDir outside;
  WriteFile(outside / "precious", "keep me");
  const std::string tree = sandbox_.host("/private/var/tree");
  ASSERT_EQ(::mkdir(tree.c_str(), 0755), 0);
  ASSERT_EQ(::mkdir((tree + "/sub").c_str(), 0755), 0);
  ASSERT_EQ(::symlink(outside.path().c_str(), (tree + "/sub/escape").c_str()), 0);
  ASSERT_EQ(::symlink("/", (tree + "/root").c_str()), 0);
  EXPECT_EQ(command("removeWorkContainer:", "/private/var/tree"), true);
  EXPECT_FALSE(Exists(tree));
  EXPECT_EQ(ReadFile(outside / "precious"), "keep me");
  EXPECT_TRUE(Exists(sandbox_.host("/private/var/mobile")));
}

TEST_F(ContainersTest, PreferencesMoveOnlyWhenThereIsSomethingToMove) {
  const std::string source = sandbox_.host("/var/root/Library/Preferences/com.orvane.Vitrell.plist");
  const std::string target = sandbox_.host("/var/mobile/Library/Preferences/com.orvane.Vitrell.plist");
  const struct {
    bool source, target;
  } refused[] = {{false, false}, {false, true}, {true, true}};
  for (const auto& c : refused) {
    ::unlink(source.c_str());
    ::unlink(target.c_str());
    if (c.source) WriteFile(source, "source");
    if (c.target) WriteFile(target, "target");
    EXPECT_EQ(command("migratePreferencesFile:", XpcObject::Bool(true)), false) << c.source << c.target;
    EXPECT_EQ(Exists(source), c.source);
    if (c.target) {
      EXPECT_EQ(ReadFile(target), "target");
    }
  }
  EXPECT_EQ(sandbox_.log().find("Couldn't"), std::string::npos);

  ::unlink(target.c_str());
  // Any parameter value will do.
  EXPECT_EQ(command("migratePreferencesFile:", XpcObject::String("anything")), true);
  EXPECT_FALSE(Exists(source));
  EXPECT_EQ(ReadFile(target), "source");
  EXPECT_EQ(Lstat(target).st_uid, kMobileUid);
  EXPECT_EQ(Lstat(target).st_gid, kMobileGid);
}

// The operation itself, without the helper: with the flag off the mode stays.
}  // namespace
}  // namespace vtr::testing
