// The helper killed (SIGKILL) in the middle of its work, restarted on the
// same root and asked again, as a client does when no answer came: nothing
// may be lost, nothing half written may stay or be put in place.
#include <poll.h>
#include <signal.h>
#include <sys/inotify.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <map>
#include <memory>
#include <thread>

#include <gtest/gtest.h>

#include "platform/format.h"
#include "platform/make_directories.h"
#include "platform/unique_fd.h"
#include "tests/support/file_inspection.h"
#include "tests/support/test_support.h"
#include "tests/vitd_helper/helper_sandbox.h"

namespace vtr::testing {
namespace {

using namespace std::chrono_literals;
namespace fs = std::filesystem;

std::vector<std::string> Names(const std::string& dir) {
  std::vector<std::string> names;
  std::error_code error;
  for (const fs::directory_entry& e : fs::directory_iterator(dir, error)) names.push_back(e.path().filename());
  std::sort(names.begin(), names.end());
  return names;
}

// A tree of folders of small files whose bytes say which tree and file they
// belong to, and every file of a tree with its bytes ("" when not there).
void MakeTree(const std::string& root, const std::string& tag, int folders, int files) {
  for (int d = 0; d < folders; ++d) {
    ASSERT_TRUE(MakeDirectories(root + "/d" + std::to_string(d)).ok());
    for (int f = 0; f < files; ++f) WriteFile(root + Format("/d%d/f%d", d, f), tag + std::to_string(d * files + f));
  }
}
std::string TreeText(const std::string& root) {
  std::map<std::string, std::string> files;
  std::error_code error;
  for (const fs::directory_entry& e : fs::recursive_directory_iterator(root, error)) {
    if (e.is_regular_file()) files[e.path().lexically_relative(root)] = ReadFile(e.path());
  }
  std::string text;
  for (const auto& [name, content] : files) text += name + "=" + content + ";";
  return text;
}

// Does act as soon as an entry whose name begins with prefix is created,
// renamed into or removed from one of folders, answering what it answers;
// false when none was before limit.
bool ActWhenSeen(const std::vector<std::string>& folders, const std::string& prefix, std::chrono::milliseconds limit,
                 const std::function<void()>& start, const std::function<bool()>& act) {
  UniqueFd watch(::inotify_init1(IN_CLOEXEC | IN_NONBLOCK));
  for (const std::string& f : folders) ::inotify_add_watch(watch.get(), f.c_str(), IN_CREATE | IN_MOVED_TO | IN_DELETE);
  start();
  alignas(struct inotify_event) char buffer[4096];
  for (const auto deadline = std::chrono::steady_clock::now() + limit; std::chrono::steady_clock::now() < deadline;) {
    struct pollfd ready = {watch.get(), POLLIN, 0};
    const ssize_t n = ::poll(&ready, 1, 10) > 0 ? ::read(watch.get(), buffer, sizeof buffer) : 0;
    for (ssize_t at = 0; at < n;) {
      const auto* event = reinterpret_cast<const struct inotify_event*>(buffer + at);
      if (event->len > 0 && std::string(event->name).rfind(prefix, 0) == 0) return act();
      at += static_cast<ssize_t>(sizeof(struct inotify_event) + event->len);
    }
  }
  return false;
}

class DurabilityTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (!IsRoot()) GTEST_SKIP() << "the helper chroots into its sandbox root and the test mounts a tmpfs: needs root";
  }
  // The staging folder's file system, another than /private/var's.
  void mountStagingFileSystem() {
    ASSERT_TRUE(MakeDirectories(stageFs).ok());
    other_ = std::make_unique<TmpfsMount>(stageFs, "64m");
    ASSERT_TRUE(other_->ok()) << "cannot mount a tmpfs here";
  }

  HelperSandbox sandbox_;
  const std::string var = sandbox_.host("/private/var"), stageFs = var + "/mobile/stage-fs";
  const std::string staging = stageFs + "/VTR_staging", backup = var + "/backup";
  const XpcObject stagingPath = XpcObject::String("/private/var/mobile/stage-fs/VTR_staging");
  std::unique_ptr<TmpfsMount> other_;
};

TEST_F(DurabilityTest, AMoveAcrossFileSystemsKilledAnywhereEndsWithTheOldOrTheWholeNewContent) {
  ASSERT_NO_FATAL_FAILURE(mountStagingFileSystem());
  // Killed when an entry of this name appears or goes (in /private/var, on
  // the staging file system or in the staging tree); nullptr: not killed.
  for (const char* seen : {".backup.incoming-", ".backup.ready", ".VTR_staging.moving", "f", ".backup.outgoing",
                           static_cast<const char*>(nullptr)}) {
    SCOPED_TRACE(seen ? seen : "not killed");
    RemoveTree(backup);
    MakeTree(backup, "old", 2, 10);
    MakeTree(staging, "new", 20, 40);
    const std::string oldText = TreeText(backup), newText = TreeText(staging);
    ASSERT_TRUE(sandbox_.start()) << sandbox_.log();
    std::thread client;
    const bool killed = ActWhenSeen(
        {var, stageFs, staging + "/d0"}, seen ? seen : "", seen ? 20s : 0s,
        [&] { client = std::thread([&] { Answer(sandbox_, "moveStagingToFinal:", stagingPath, 60s); }); },
        [&] { return ::kill(sandbox_.pid(), SIGKILL) == 0; });
    client.join();
    EXPECT_EQ(killed, seen != nullptr) << "the helper finished before it was seen at work";
    EXPECT_EQ(killed ? sandbox_.waitForExit(5s) : sandbox_.terminate(), killed ? -1 : 0);
    const std::string now = TreeText(backup);
    EXPECT_TRUE(now == oldText || now == newText) << "a mix or a part stands in place";

    // Restarted, the helper finishes or removes what the kill left, and
    // says so.
    std::vector<std::string> left = Names(var);
    const bool leftovers = Exists(stageFs + "/.VTR_staging.moving") ||
                           std::any_of(left.begin(), left.end(), [](auto& n) { return n.rfind(".backup", 0) == 0; });
    ASSERT_TRUE(sandbox_.start()) << sandbox_.log();
    EXPECT_EQ(sandbox_.log().find("an interrupted move") != std::string::npos, leftovers) << sandbox_.log();
    const bool stagingLeft = Exists(staging);
    EXPECT_EQ(Names(stageFs), stagingLeft ? std::vector<std::string>{"VTR_staging"} : std::vector<std::string>{});
    for (const std::string& name : Names(var)) EXPECT_NE(name.rfind(".backup", 0), 0u) << name;
    // Asked again: a staging folder still there (and whole) is moved; one
    // gone answers as any missing staging folder does, its content in place.
    EXPECT_TRUE(!stagingLeft || TreeText(staging) == newText);
    EXPECT_EQ(Answer(sandbox_, "moveStagingToFinal:", stagingPath, 60s), stagingLeft);
    EXPECT_TRUE(TreeText(backup) == newText) << "not the whole new content";
    EXPECT_FALSE(Exists(staging));
    EXPECT_EQ(sandbox_.terminate(), 0);
  }
}

TEST_F(DurabilityTest, ContentThatCannotBeSyncedIsNeverPutInPlace) {
  if (!CanFailSyscalls()) GTEST_SKIP() << "no seccomp filter for this architecture";
  ASSERT_NO_FATAL_FAILURE(mountStagingFileSystem());
  sandbox_.failSyscalls({SYS_syncfs}, EIO);
  ASSERT_TRUE(sandbox_.start()) << sandbox_.log();
  for (const std::string folder : {"/private/var/mobile/stage-fs", "/private/var/mobile"}) {  // another file system, the same
    SCOPED_TRACE(folder);
    MakeTree(backup, "old", 1, 1);
    MakeTree(sandbox_.host(folder + "/VTR_staging"), "new", 2, 2);
    const std::string newText = TreeText(sandbox_.host(folder + "/VTR_staging"));
    EXPECT_EQ(Answer(sandbox_, "moveStagingToFinal:", XpcObject::String(folder + "/VTR_staging")), false);
    EXPECT_EQ(TreeText(sandbox_.host(folder + "/VTR_staging")), newText);
    EXPECT_FALSE(Exists(backup)) << "the old content is discarded, as a move always does";
    for (const std::string& name : Names(var)) EXPECT_NE(name.rfind(".backup", 0), 0u) << name;
    EXPECT_NE(sandbox_.log().find("Could not move " + folder + "/VTR_staging to /var/backup with error - syncfs "
                                  "/private/var/.backup."),
              std::string::npos)
        << sandbox_.log();
  }
}

TEST_F(DurabilityTest, AManifestKilledMidScanLeavesNothingAndTheOldManifestWhole) {
  const std::string work = sandbox_.host("/private/var/VTRWorkContainer");
  ASSERT_EQ(::mkdir(work.c_str(), 0755), 0);
  WriteFile(work + "/DeviceManifest.plist", "earlier manifest");
  // Large files (holes, quick to make) keep the scan hashing for a while.
  ASSERT_TRUE(MakeDirectories(sandbox_.host("/private/var/mobile/Media")).ok());
  for (int i = 0; i < 8; ++i) {
    const std::string big = sandbox_.host("/private/var/mobile/Media/big" + std::to_string(i));
    WriteFile(big, "");
    ASSERT_EQ(::truncate(big.c_str(), off_t{256} << 20), 0);
  }
  const XpcObject request = XpcObject::Dictionary(
      {{"Path", XpcObject::String("/private/var/mobile")}, {"Inclusive", XpcObject::Bool(false)}});
  ASSERT_TRUE(sandbox_.start()) << sandbox_.log();
  std::thread client([&] { Answer(sandbox_, "createDeviceManifest:", request, 60s); });
  std::this_thread::sleep_for(300ms);  // into the scan
  ::kill(sandbox_.pid(), SIGKILL);
  client.join();
  sandbox_.waitForExit(5s);
  EXPECT_EQ(Names(work), std::vector<std::string>{"DeviceManifest.plist"});
  EXPECT_EQ(ReadFile(work + "/DeviceManifest.plist"), "earlier manifest");

  // A kill in the moment between the file's naming and its rename leaves
  // the name; the next start removes it, and nothing else.
  WriteFile(work + "/.DeviceManifest.plist.Ab12Cd", "synced, not renamed");
  WriteFile(work + "/.DeviceManifest.plist.notes", "the client's");
  ASSERT_TRUE(sandbox_.start()) << sandbox_.log();
  EXPECT_EQ(Names(work), (std::vector<std::string>{".DeviceManifest.plist.notes", "DeviceManifest.plist"}));
  EXPECT_TRUE(sandbox_.logged("Removing /private/var/VTRWorkContainer/.DeviceManifest.plist.Ab12Cd, the file of a "
                              "device manifest that was not finished"));
  EXPECT_EQ(Answer(sandbox_, "createDeviceManifest:", request, 60s), true);
  EXPECT_EQ(ReadFile(work + "/DeviceManifest.plist").rfind("bplist00", 0), 0u);
  EXPECT_EQ(sandbox_.terminate(), 0);
}

TEST_F(DurabilityTest, WhatAClientHadLinkedUnderTheHelpersNamesIsNeitherPutInPlaceNorWaitedOn) {
  // A client may have the helper link its own link, file or fifo under the
  // name of ready content or of a record: the next start must not put it in
  // place nor block on it.
  MakeTree(backup, "old", 1, 2);
  const std::string oldText = TreeText(backup);
  ASSERT_EQ(::symlink("/private/var/root", sandbox_.host("/private/var/mobile/l").c_str()), 0);
  WriteFile(sandbox_.host("/private/var/mobile/f"), "client file");
  ASSERT_EQ(::mkfifo(sandbox_.host("/private/var/mobile/p").c_str(), 0644), 0);
  ASSERT_TRUE(MakeDirectories(sandbox_.host("/private/var/mobile/d")).ok());
  // Records killed between their naming and their rename go too.
  WriteFile(var + "/..backup.placing.Ab12Cd", "1");
  WriteFile(var + "/..backup.source.Ab12Cd", "/private/var/mobile/.VTR_staging.moving");
  const std::pair<const char*, const char*> cases[] = {{"/private/var/mobile/l", "/private/var/.backup.ready"},
                                                       {"/private/var/mobile/f", "/private/var/.backup.ready"},
                                                       {"/private/var/mobile/p", "/private/var/.backup.placing"},
                                                       {"/private/var/mobile/p", "/private/var/.backup.source"},
                                                       {"/private/var/mobile/d", "/private/var/.backup.source"},
                                                       {"/private/var/mobile/d", "/private/var/.backup.placing"}};
  for (const auto& [planted, name] : cases) {
    SCOPED_TRACE(std::string(planted) + " as " + name);
    ASSERT_TRUE(sandbox_.start()) << sandbox_.log();
    EXPECT_EQ(Answer(sandbox_, "createHardLink:",
                     XpcObject::Dictionary(
                         {{"FilePath", XpcObject::String(planted)}, {"StagingPath", XpcObject::String(name)}})),
              true);
    EXPECT_EQ(sandbox_.terminate(), 0);
    ASSERT_TRUE(sandbox_.start()) << sandbox_.log();
    EXPECT_EQ(sandbox_.terminate(), 0);
    EXPECT_TRUE(S_ISDIR(Lstat(backup).st_mode)) << sandbox_.log();
    EXPECT_EQ(TreeText(backup), oldText);
    for (const std::string& left : Names(var)) EXPECT_EQ(left.find("backup."), std::string::npos) << left;
  }
}

TEST_F(DurabilityTest, AFolderSwappedInForTheStagingFolderDuringTheCopyIsNeitherMovedNorRemoved) {
  ASSERT_NO_FATAL_FAILURE(mountStagingFileSystem());
  MakeTree(staging, "new", 20, 40);
  ASSERT_TRUE(sandbox_.start()) << sandbox_.log();
  std::thread client;
  std::optional<bool> answer;
  // Once the copy has begun, the client puts another folder in its place.
  EXPECT_TRUE(ActWhenSeen(
      {var}, ".backup.incoming-", 20s,
      [&] { client = std::thread([&] { answer = Answer(sandbox_, "moveStagingToFinal:", stagingPath, 60s); }); },
      [&] {
        const bool swapped = ::rename(staging.c_str(), (stageFs + "/checked").c_str()) == 0 && MakeDirectories(staging).ok();
        WriteFile(staging + "/swapped", "in");
        return swapped;
      }));
  client.join();
  EXPECT_EQ(answer, false);
  EXPECT_EQ(ReadFile(staging + "/swapped"), "in");
  EXPECT_EQ(Names(stageFs), (std::vector<std::string>{"VTR_staging", "checked"}));
  EXPECT_EQ(sandbox_.terminate(), 0);
}

TEST_F(DurabilityTest, ASecondHelperOnTheSameRootLeavesTheFirstOnesWorkAlone) {
  ASSERT_TRUE(sandbox_.start()) << sandbox_.log();
  // What the running helper has under way: a copy being made, a manifest's
  // file between its naming and its rename.
  MakeTree(var + "/.backup.incoming-abc123", "copy", 1, 1);
  ASSERT_EQ(::mkdir((var + "/VTRWorkContainer").c_str(), 0755), 0);
  WriteFile(var + "/VTRWorkContainer/.DeviceManifest.plist.Ab12Cd", "being renamed");
  const HelperSandbox::RunResult second = sandbox_.run(HelperExecutable(), {"--root", sandbox_.root(), "--stderr"});
  EXPECT_NE(second.status, 0);
  EXPECT_TRUE(Exists(var + "/.backup.incoming-abc123/d0/f0")) << second.errors;
  EXPECT_TRUE(Exists(var + "/VTRWorkContainer/.DeviceManifest.plist.Ab12Cd")) << second.errors;
  EXPECT_EQ(sandbox_.terminate(), 0);
}

}  // namespace
}  // namespace vtr::testing
