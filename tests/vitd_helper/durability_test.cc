// The helper killed (SIGKILL) in the middle of its work, restarted on the
// same root and asked again, as a client does when no answer came: nothing
// may be lost, nothing half written may stay or be put in place.
#include <dirent.h>
#include <signal.h>
#include <sys/inotify.h>
#include <poll.h>
#include <unistd.h>

#include <algorithm>
#include <thread>

#include <gtest/gtest.h>

#include "platform/make_directories.h"
#include "platform/unique_fd.h"
#include "tests/support/file_inspection.h"
#include "tests/support/test_support.h"
#include "tests/vitd_helper/helper_sandbox.h"

namespace vtr::testing {
namespace {

using namespace std::chrono_literals;

// The machine may be busy: an answer is awaited for a minute.
std::optional<bool> Answer(HelperSandbox& sandbox, const std::string& key, XpcObject parameter,
                           std::chrono::milliseconds quiet = 60s) {
  for (const XpcObject& reply : sandbox.request(XpcObject::Dictionary({{key, std::move(parameter)}}), 1, quiet)) {
    if (const XpcObject* response = reply.find("Response")) return response->boolValue();
  }
  return std::nullopt;
}

// The entries of a folder, sorted.
std::vector<std::string> Names(const std::string& dir) {
  std::vector<std::string> names;
  if (DIR* d = ::opendir(dir.c_str())) {
    while (struct dirent* e = ::readdir(d)) {
      if (std::string(e->d_name) != "." && std::string(e->d_name) != "..") names.emplace_back(e->d_name);
    }
    ::closedir(d);
  }
  std::sort(names.begin(), names.end());
  return names;
}

// A tree of folders and small files whose every byte says which tree and
// file it belongs to, and what such a tree holds ("" when not there).
void MakeTree(const std::string& root, const std::string& tag, int folders, int files) {
  ASSERT_TRUE(MakeDirectories(root).ok());
  for (int d = 0; d < folders; ++d) {
    const std::string folder = root + "/d" + std::to_string(d);
    ASSERT_EQ(::mkdir(folder.c_str(), 0755), 0);
    for (int f = 0; f < files; ++f) WriteFile(folder + "/f" + std::to_string(f), tag + std::to_string(d * files + f));
  }
}
std::string TreeText(const std::string& root) {
  std::string text;
  for (const std::string& d : Names(root)) {
    for (const std::string& f : Names(root + "/" + d)) text += d + "/" + f + "=" + ReadFile(root + "/" + d + "/" + f) + ";";
  }
  return text;
}

// Sends SIGKILL to the helper as soon as an entry whose name begins with a
// prefix appears (created or renamed) or goes in one of folders; true when
// it did before the helper answered.
class KillWhenSeen {
 public:
  KillWhenSeen(HelperSandbox& sandbox, const std::vector<std::string>& folders)
      : sandbox_(sandbox), inotify_(::inotify_init1(IN_CLOEXEC | IN_NONBLOCK)) {
    for (const std::string& f : folders) ::inotify_add_watch(inotify_.get(), f.c_str(), IN_CREATE | IN_MOVED_TO | IN_DELETE);
  }
  bool wait(const std::string& prefix, std::chrono::milliseconds limit) {
    const auto deadline = std::chrono::steady_clock::now() + limit;
    alignas(struct inotify_event) char buffer[4096];
    while (std::chrono::steady_clock::now() < deadline) {
      struct pollfd p = {inotify_.get(), POLLIN, 0};
      if (::poll(&p, 1, 10) <= 0) continue;
      const ssize_t n = ::read(inotify_.get(), buffer, sizeof buffer);
      for (ssize_t at = 0; at < n;) {
        const auto* event = reinterpret_cast<const struct inotify_event*>(buffer + at);
        if (event->len > 0 && std::string(event->name).rfind(prefix, 0) == 0) {
          ::kill(sandbox_.pid(), SIGKILL);
          return true;
        }
        at += static_cast<ssize_t>(sizeof(struct inotify_event) + event->len);
      }
    }
    return false;
  }

 private:
  HelperSandbox& sandbox_;
  UniqueFd inotify_;
};

class DurabilityTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (!IsRoot()) GTEST_SKIP() << "the helper chroots into its sandbox root and the test mounts a tmpfs: needs root";
  }
  HelperSandbox sandbox_;
};

TEST_F(DurabilityTest, AMoveAcrossFileSystemsKilledAnywhereEndsWithTheOldOrTheWholeNewContent) {
  const std::string var = sandbox_.host("/private/var");
  const std::string stageFs = var + "/mobile/stage-fs";
  ASSERT_TRUE(MakeDirectories(stageFs).ok());
  TmpfsMount other(stageFs, "64m");
  ASSERT_TRUE(other.ok()) << "cannot mount a tmpfs here";
  const std::string staging = stageFs + "/VTR_staging";
  const std::string backup = var + "/backup";
  // Where the helper is killed: when an entry of this name appears or goes
  // (in /private/var, the staging file system or the staging tree).
  const struct {
    const char* what;
    const char* seen;  // nullptr: not killed
  } cases[] = {
      {"while copying", ".backup.incoming-"},
      {"once the copy is whole", ".backup.ready"},
      {"once the staging folder is set aside", ".VTR_staging.moving"},
      {"while the staging folder's files are removed", "f"},
      {"while the old content goes", ".backup.outgoing"},
      {"not at all", nullptr},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.what);
    RemoveTree(backup);
    MakeTree(backup, "old", 2, 10);
    MakeTree(staging, "new", 20, 40);
    const std::string oldText = TreeText(backup);
    const std::string newText = TreeText(staging);
    ASSERT_TRUE(sandbox_.start()) << sandbox_.log();

    KillWhenSeen killer(sandbox_, {var, stageFs, staging + "/d0"});
    std::optional<bool> answer;
    std::thread client([&] { answer = Answer(sandbox_, "moveStagingToFinal:", XpcObject::String(
                                                                                  "/private/var/mobile/stage-fs/VTR_staging")); });
    const bool killed = c.seen != nullptr && killer.wait(c.seen, 20s);
    client.join();
    EXPECT_EQ(killed, c.seen != nullptr) << "the helper finished before it was seen at work";
    if (killed) {
      sandbox_.waitForExit(5s);
    } else {
      EXPECT_EQ(sandbox_.terminate(), 0);
    }
    const std::string now = TreeText(backup);
    EXPECT_TRUE(now == oldText || now == newText) << "killed: a mix or a part stands in place";

    // Restarted, the helper finishes or removes what the kill left.
    ASSERT_TRUE(sandbox_.start()) << sandbox_.log();
    EXPECT_EQ(Names(stageFs), Exists(staging) ? std::vector<std::string>{"VTR_staging"} : std::vector<std::string>{});
    const std::vector<std::string> left = Names(var);
    EXPECT_EQ(std::count_if(left.begin(), left.end(), [](const std::string& n) { return n.rfind(".backup", 0) == 0; }),
              0) << ::testing::PrintToString(left);
    // Asked again: a staging folder still there is moved; one gone answers as
    // any missing staging folder does, and its content stands whole.
    const bool stagingLeft = Exists(staging);
    EXPECT_TRUE(!stagingLeft || TreeText(staging) == newText);
    EXPECT_EQ(Answer(sandbox_, "moveStagingToFinal:", XpcObject::String("/private/var/mobile/stage-fs/VTR_staging")),
              stagingLeft);
    EXPECT_TRUE(TreeText(backup) == newText) << "not the whole new content";
    EXPECT_FALSE(Exists(staging));
    if (!stagingLeft) {
      EXPECT_TRUE(sandbox_.logged("Staging path /private/var/mobile/stage-fs/VTR_staging looks wrong."));
    }
    EXPECT_EQ(sandbox_.terminate(), 0);
  }
}

TEST_F(DurabilityTest, AManifestKilledMidScanLeavesNothingAndTheOldManifestWhole) {
  const std::string work = sandbox_.host("/private/var/VTRWorkContainer");
  ASSERT_EQ(::mkdir(work.c_str(), 0755), 0);
  // Large files (holes, quick to make) keep the scan hashing for a while.
  ASSERT_EQ(::mkdir(sandbox_.host("/private/var/mobile/Media").c_str(), 0755), 0);
  for (int i = 0; i < 8; ++i) {
    const std::string big = sandbox_.host("/private/var/mobile/Media/big" + std::to_string(i));
    WriteFile(big, "");
    ASSERT_EQ(::truncate(big.c_str(), off_t{256} << 20), 0);
  }
  WriteFile(work + "/DeviceManifest.plist", "earlier manifest");
  const XpcObject request = XpcObject::Dictionary(
      {{"Path", XpcObject::String("/private/var/mobile")}, {"Inclusive", XpcObject::Bool(false)}});
  ASSERT_TRUE(sandbox_.start()) << sandbox_.log();
  std::thread client([&] { (void)Answer(sandbox_, "createDeviceManifest:", request); });
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
  EXPECT_EQ(Answer(sandbox_, "createDeviceManifest:", request), true);
  EXPECT_EQ(ReadFile(work + "/DeviceManifest.plist").rfind("bplist00", 0), 0u);
  EXPECT_EQ(sandbox_.terminate(), 0);
}

}  // namespace
}  // namespace vtr::testing
