// The helper attacked as its threat model says it may be, end to end in a
// sandbox root: by a compromised entitled client (planted links, swapped
// entries, hostile paths, huge files) and by any local user (floods from a
// peer without the entitlement, run as uid 65534 by hostile_peer.py).
#include <dirent.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstring>
#include <fstream>
#include <sstream>
#include <thread>

#include <gtest/gtest.h>

#include "platform/unique_fd.h"
#include "tests/support/file_inspection.h"
#include "tests/support/test_support.h"
#include "tests/vitd_helper/helper_sandbox.h"

namespace vtr::testing {
namespace {

using namespace std::chrono_literals;

XpcObject Request(const std::string& key, XpcObject parameter) {
  return XpcObject::Dictionary({{key, std::move(parameter)}});
}

// A field of /proc/PID/status in kB ("VmHWM", "VmRSS"), or -1.
long StatusKilobytes(pid_t pid, const std::string& field) {
  std::ifstream status("/proc/" + std::to_string(pid) + "/status");
  std::string line;
  while (std::getline(status, line)) {
    if (line.rfind(field + ":", 0) == 0) return std::stol(line.substr(field.size() + 1));
  }
  return -1;
}

// Resets the peak the kernel records, so that a later VmHWM is the peak since now.
void ResetPeak(pid_t pid) {
  std::ofstream("/proc/" + std::to_string(pid) + "/clear_refs") << "5";
}

// hostile_peer.py against the sandbox's socket; its one line of output.
std::string Hostile(const HelperSandbox& sandbox, const std::string& mode, const std::string& arg) {
  const std::string script = std::string(VTR_SOURCE_DIR) + "/tests/vitd_helper/hostile_peer.py";
  return sandbox.run("/usr/bin/python3", {script, sandbox.socketPath(), mode, arg}).output;
}

class SecurityTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (!IsRoot()) GTEST_SKIP() << "the helper chroots into its sandbox root: needs root";
  }
  void Start() { ASSERT_TRUE(sandbox_.start()) << sandbox_.log(); }

  HelperSandbox sandbox_;
};

TEST_F(SecurityTest, TheHelpersOwnLogCannotBeTurnedAgainstIt) {
  // The day's file planted as a link to a file the client wants written.
  const std::string passwd = sandbox_.host("/etc/passwd");
  const std::string before = ReadFile(passwd);
  ASSERT_EQ(::mkdir(sandbox_.host("/private/var/logs/vitd").c_str(), 0755), 0);
  ASSERT_EQ(::symlink("../../../../etc/passwd", sandbox_.dayLogPath().c_str()), 0);
  Start();
  EXPECT_EQ(Answer(sandbox_, "removeWorkContainer:", XpcObject::String("/private/var/absent")), true);
  EXPECT_EQ(ReadFile(passwd), before);
  EXPECT_NE(sandbox_.log().find("is not a regular file of this user with one link"), std::string::npos);
  EXPECT_EQ(sandbox_.terminate(), 0);

  // A fifo in its place blocks nothing.
  ASSERT_EQ(::unlink(sandbox_.dayLogPath().c_str()), 0);
  ASSERT_EQ(::mkfifo(sandbox_.dayLogPath().c_str(), 0644), 0);
  Start();
  EXPECT_EQ(Answer(sandbox_, "removeWorkContainer:", XpcObject::String("/private/var/absent")), true);
  EXPECT_EQ(sandbox_.terminate(), 0);

  // A folder others may write is not used at all, and no command of the
  // client opens it: it is a closed tree.
  ASSERT_EQ(::unlink(sandbox_.dayLogPath().c_str()), 0);
  ASSERT_EQ(::chmod(sandbox_.host("/private/var/logs/vitd").c_str(), 0777), 0);
  Start();
  EXPECT_NE(sandbox_.log().find("logging to the system log only"), std::string::npos);
  EXPECT_FALSE(Exists(sandbox_.dayLogPath()));
  ASSERT_EQ(::chmod(sandbox_.host("/private/var/logs/vitd").c_str(), 0755), 0);
  for (const char* path : {"/var/logs/vitd", "/private/var/logs/vitd/", "/private/var/logs/../logs/vitd"}) {
    EXPECT_EQ(Answer(sandbox_, "prepareLogContainer:", XpcObject::String(path)), false) << path;
  }
  EXPECT_EQ(Lstat(sandbox_.host("/private/var/logs/vitd")).st_mode & 07777, 0755u);
}

TEST_F(SecurityTest, TheDayFileIsNamedByTheLocalDateInsideTheRootToo) {
  // Fourteen hours east of UTC or eleven west: one of them is another day
  // than UTC right now. The zone is a file the sandbox root does not hold,
  // named so that its name alone does not tell the offset.
  const time_t now = ::time(nullptr);
  struct tm utc;
  ::gmtime_r(&now, &utc);
  const char* zone = utc.tm_hour >= 10 ? "Pacific/Kiritimati" : "Pacific/Pago_Pago";
  const std::string file = std::string("/usr/share/zoneinfo/") + zone;
  if (::access(file.c_str(), R_OK) != 0) GTEST_SKIP() << file << " is missing";
  const char* previous = std::getenv("TZ");
  const std::string saved = previous ? previous : "";
  ::setenv("TZ", (":" + file).c_str(), 1);
  ::tzset();
  Start();
  const std::string expected = sandbox_.dayLogPath();  // the test's own local date, in that zone
  if (previous) {
    ::setenv("TZ", saved.c_str(), 1);
  } else {
    ::unsetenv("TZ");
  }
  ::tzset();
  EXPECT_TRUE(Exists(expected)) << expected << "\n" << sandbox_.log();
}

TEST_F(SecurityTest, OneCallIsOneLineWhateverTheClientSends) {
  Start();
  const std::string forged = "/private/var/x\n2026-01-01 00:00:00 +0000 forged line\t\x1b[31m";
  EXPECT_EQ(Answer(sandbox_, "prepareWorkContainer:", XpcObject::String(forged)), true);
  EXPECT_EQ(Answer(sandbox_, "removeWorkContainer:", XpcObject::String(std::string(100 * 1024, 'a'))), false);
  std::istringstream day(ReadFile(sandbox_.dayLogPath()));
  std::string line;
  size_t lines = 0;
  while (std::getline(day, line)) {
    ++lines;
    EXPECT_NE(line.rfind("2026-01-01 00:00:00 +0000 forged", 0), 0u) << "a line of its own: " << line;
    EXPECT_LE(line.size(), 64u * 1024 + 32) << "a line longer than the cap";
    EXPECT_EQ(line.find('\x1b'), std::string::npos);
  }
  EXPECT_GT(lines, 4u);
  EXPECT_NE(ReadFile(sandbox_.dayLogPath()).find("/private/var/x\\n2026-01-01"), std::string::npos);
}

TEST_F(SecurityTest, SwappingAnEntryForALinkDuringPrepareLogContainerNeverHandsOverRootsFiles) {
  Start();
  const std::string container = sandbox_.host("/private/var/logs/race");
  ASSERT_EQ(::mkdir(container.c_str(), 0755), 0);
  const std::string entry = container + "/vitd-x";
  const std::string aside = container + "/aside";
  ASSERT_EQ(::mkdir(aside.c_str(), 0755), 0);
  ASSERT_EQ(::symlink("../../root", (container + "/vitd-lnk").c_str()), 0);
  WriteFile(sandbox_.host("/private/var/root/secret"), "s");
  std::atomic<bool> stop{false};
  std::thread swapper([&] {
    // As mobile would in a folder it may write: the entry is a directory one
    // moment, a link to root's home the next.
    while (!stop) {
      ::rename(aside.c_str(), entry.c_str());
      ::rename(entry.c_str(), aside.c_str());
      ::symlink("../../root", entry.c_str());
      ::unlink(entry.c_str());
    }
  });
  for (int i = 0; i < 150; ++i) {
    if (Answer(sandbox_, "prepareLogContainer:", XpcObject::String("/private/var/logs/race")) != true) {
      ADD_FAILURE() << "request " << i << " was not answered true";
      break;
    }
  }
  stop = true;
  swapper.join();
  EXPECT_EQ(Lstat(sandbox_.host("/private/var/root")).st_uid, 0u);
  EXPECT_EQ(Lstat(sandbox_.host("/private/var/root/secret")).st_uid, 0u);
  EXPECT_EQ(Lstat(sandbox_.host("/private/var/root")).st_mode & 07777, 0755u);
}

TEST_F(SecurityTest, HardLinkingARootFileIntoALogContainerDoesNotHandItOver) {
  Start();
  WriteFile(sandbox_.host("/private/var/db-secret"), "s");
  ASSERT_EQ(::chmod(sandbox_.host("/private/var/db-secret").c_str(), 0600), 0);
  ASSERT_EQ(Answer(sandbox_, "prepareLogContainer:", XpcObject::String("/private/var/logs/l")), true);
  const XpcObject link = XpcObject::Dictionary({{"FilePath", XpcObject::String("/private/var/db-secret")},
                                                {"StagingPath", XpcObject::String("/private/var/logs/l/vitd-1")}});
  ASSERT_EQ(Answer(sandbox_, "createHardLink:", link), true);
  EXPECT_EQ(Answer(sandbox_, "prepareLogContainer:", XpcObject::String("/private/var/logs/l")), true);
  EXPECT_EQ(Lstat(sandbox_.host("/private/var/db-secret")).st_uid, 0u);
  // Root's home is closed: nothing in it can be linked out.
  WriteFile(sandbox_.host("/private/var/root/secret"), "s");
  const XpcObject fromRoot = XpcObject::Dictionary({{"FilePath", XpcObject::String("/var/root/secret")},
                                                    {"StagingPath", XpcObject::String("/private/var/logs/l/vitd-2")}});
  EXPECT_EQ(Answer(sandbox_, "createHardLink:", fromRoot), false);
  EXPECT_FALSE(Exists(sandbox_.host("/private/var/logs/l/vitd-2")));
  EXPECT_NE(sandbox_.log().find("Refused path /var/root/secret: inside the closed tree /private/var/root"),
            std::string::npos);
}

TEST_F(SecurityTest, AnAreasFileOthersCouldWriteKeepsTheHelperFromStarting) {
  ASSERT_EQ(::mkdir(sandbox_.host("/etc/vitd").c_str(), 0755), 0);
  WriteFile(sandbox_.host("/etc/vitd/helper.conf"), "area /private/var/mobile\n");
  ASSERT_EQ(::chmod(sandbox_.host("/etc/vitd/helper.conf").c_str(), 0666), 0);
  EXPECT_FALSE(sandbox_.start());
  EXPECT_EQ(sandbox_.waitForExit(5s), 1);
  EXPECT_NE(sandbox_.log().find("refusing to start: /etc/vitd/helper.conf is writable by group or others"),
            std::string::npos)
      << sandbox_.log();
  // Made safe, it is obeyed: only mobile's tree is an area now.
  ASSERT_EQ(::chmod(sandbox_.host("/etc/vitd/helper.conf").c_str(), 0644), 0);
  Start();
  EXPECT_EQ(Answer(sandbox_, "prepareWorkContainer:", XpcObject::String("/private/var/mobile/w")), true);
  EXPECT_EQ(Answer(sandbox_, "prepareWorkContainer:", XpcObject::String("/private/var/w")), false);
}

TEST_F(SecurityTest, PeersWithoutTheEntitlementCostLittleAndLockNobodyOut) {
  Start();
  // More connections than one user may hold: the surplus is closed at once,
  // and the entitled client (another user) is served all the while.
  EXPECT_EQ(Hostile(sandbox_, "idle", "100"), "opened=100 closed=68\n");
  EXPECT_EQ(Answer(sandbox_, "removeWorkContainer:", XpcObject::String("/private/var/absent")), true);
  // Root without the entitlement is held to the same, and never takes the
  // slots of the entitled client, root as well.
  ::setenv("HOSTILE_AS_ROOT", "1", 1);
  EXPECT_EQ(Hostile(sandbox_, "idle", "1100"), "opened=1100 closed=1068\n");
  ::unsetenv("HOSTILE_AS_ROOT");
  EXPECT_EQ(Answer(sandbox_, "removeWorkContainer:", XpcObject::String("/private/var/absent")), true);

  // 100,000 tiny frames write a bounded log, with a count of what was left out.
  const off_t logBefore = Lstat(sandbox_.dayLogPath()).st_size;
  const auto started = std::chrono::steady_clock::now();
  EXPECT_EQ(Hostile(sandbox_, "tiny", "100000"), "sent\n");
  // Until the helper has read all it was sent: the log stands still.
  for (off_t size = -1; size != Lstat(sandbox_.dayLogPath()).st_size;) {
    size = Lstat(sandbox_.dayLogPath()).st_size;
    std::this_thread::sleep_for(1s);
  }
  const double seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - started).count();
  const off_t grown = Lstat(sandbox_.dayLogPath()).st_size - logBefore;
  // A burst, then the refill rate (each admitted line may bring a count of
  // what was suppressed before it).
  EXPECT_LT(grown, static_cast<off_t>((200 + 40 * seconds) * 160)) << grown << " bytes in " << seconds << " s";
  EXPECT_EQ(Answer(sandbox_, "removeWorkContainer:", XpcObject::String("/private/var/absent")), true);
  EXPECT_NE(sandbox_.log().find("lines caused by uid 65534 were suppressed"), std::string::npos);

  // A 16 MiB frame is validated as it streams past, never stored or decoded.
  ResetPeak(sandbox_.pid());
  const long rssBefore = StatusKilobytes(sandbox_.pid(), "VmRSS");
  EXPECT_EQ(Hostile(sandbox_, "nulls", "16"), "sent=16777216 closed=0\n");
  EXPECT_LT(StatusKilobytes(sandbox_.pid(), "VmHWM") - rssBefore, 4 * 1024) << "kB more at the peak";
  EXPECT_EQ(Answer(sandbox_, "removeWorkContainer:", XpcObject::String("/private/var/absent")), true);
}

TEST_F(SecurityTest, AnEntitledFrameCostsAtMostFourTimesItsSize) {
  Start();
  // {"k": [16 MiB of nulls]}: 24 bytes an object decoded, refused unread.
  const uint32_t size = 16u << 20;
  const uint32_t count = size - 15;
  XpcBytes frame = {static_cast<uint8_t>(size), static_cast<uint8_t>(size >> 8), static_cast<uint8_t>(size >> 16),
                    static_cast<uint8_t>(size >> 24), 0x0A, 1, 0, 0, 0, 1, 0, 0, 0, 'k', 0x09,
                    static_cast<uint8_t>(count), static_cast<uint8_t>(count >> 8), static_cast<uint8_t>(count >> 16),
                    static_cast<uint8_t>(count >> 24)};
  frame.resize(frame.size() + count, 0);
  ResetPeak(sandbox_.pid());
  const long rssBefore = StatusKilobytes(sandbox_.pid(), "VmRSS");
  UniqueFd raw(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  struct sockaddr_un address = {};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, sandbox_.socketPath().c_str(), sizeof address.sun_path - 1);
  ASSERT_EQ(::connect(raw.get(), reinterpret_cast<const struct sockaddr*>(&address), sizeof address), 0);
  for (size_t sent = 0; sent < frame.size();) {
    const ssize_t n = ::send(raw.get(), frame.data() + sent, frame.size() - sent, MSG_NOSIGNAL);
    ASSERT_GT(n, 0);
    sent += static_cast<size_t>(n);
  }
  char byte;
  EXPECT_EQ(::recv(raw.get(), &byte, 1, 0), 0) << "closed as a protocol error";
  EXPECT_LT(StatusKilobytes(sandbox_.pid(), "VmHWM") - rssBefore, 5 * 16 * 1024) << "kB more at the peak";
  EXPECT_EQ(Answer(sandbox_, "removeWorkContainer:", XpcObject::String("/private/var/absent")), true);
}

TEST_F(SecurityTest, AnIdlePeerWithoutTheEntitlementIsClosedAfterTenSeconds) {
  Start();
  const std::string seen = Hostile(sandbox_, "linger", "");
  ASSERT_EQ(seen.rfind("closed=1 seconds=", 0), 0u) << seen;
  const double seconds = std::stod(seen.substr(std::string("closed=1 seconds=").size()));
  EXPECT_GE(seconds, 9.5);
  EXPECT_LE(seconds, 12.0);
}

TEST_F(SecurityTest, SigtermEndsAManifestOfAHugeFileWithinASecond) {
  Start();
  const std::string huge = sandbox_.host("/private/var/mobile/huge");
  {
    UniqueFd fd(::open(huge.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0644));
    ASSERT_EQ(::ftruncate(fd.get(), off_t{1} << 40), 0) << "a 1 TiB sparse file";
  }
  ASSERT_EQ(::mkdir(sandbox_.host("/private/var/VTRWorkContainer").c_str(), 0755), 0);
  std::thread client([this] {
    (void)sandbox_.request(Request("createDeviceManifest:", XpcObject::Dictionary({{"Path", XpcObject::String(
                                                                                                "/private/var/mobile")}})),
                           1, 20s);
  });
  std::this_thread::sleep_for(1500ms);  // well into the hashing
  const auto signalled = std::chrono::steady_clock::now();
  ::kill(sandbox_.pid(), SIGTERM);
  EXPECT_EQ(sandbox_.waitForExit(5s), 0);
  EXPECT_LT(std::chrono::steady_clock::now() - signalled, 1500ms);
  client.join();
  std::vector<std::string> left;
  if (DIR* dir = ::opendir(sandbox_.host("/private/var/VTRWorkContainer").c_str())) {
    while (struct dirent* e = ::readdir(dir)) {
      if (std::strcmp(e->d_name, ".") != 0 && std::strcmp(e->d_name, "..") != 0) left.emplace_back(e->d_name);
    }
    ::closedir(dir);
  }
  EXPECT_EQ(left, std::vector<std::string>{}) << "no manifest, not even a temporary one";
}

TEST_F(SecurityTest, AMoveAcrossFileSystemsKeepsHolesAndFailsWholeWhenThereIsNoRoom) {
  // /private/var a small file system, the staging area another.
  const std::string var = sandbox_.host("/private/var");
  TmpfsMount small(var, "48m");
  ASSERT_TRUE(small.ok()) << "cannot mount a tmpfs here";
  for (const char* d : {"/logs", "/mobile", "/mobile/stage-fs", "/root"}) ASSERT_EQ(::mkdir((var + d).c_str(), 0755), 0);
  TmpfsMount staging(var + "/mobile/stage-fs", "512m");
  ASSERT_TRUE(staging.ok());
  Start();

  // A 1 GiB file holding 1 MiB of data at its middle.
  const std::string stage = var + "/mobile/stage-fs/sparse";
  ASSERT_EQ(::mkdir(stage.c_str(), 0755), 0);
  {
    UniqueFd fd(::open((stage + "/disk.img").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0640));
    const std::string data(1 << 20, 'd');
    ASSERT_EQ(::pwrite(fd.get(), data.data(), data.size(), off_t{512} << 20), static_cast<ssize_t>(data.size()));
    ASSERT_EQ(::ftruncate(fd.get(), off_t{1} << 30), 0);
  }
  EXPECT_EQ(Answer(sandbox_, "moveStagingToFinal:", XpcObject::String("/private/var/mobile/stage-fs/sparse")), true);
  const struct stat moved = Lstat(var + "/backup/disk.img");
  EXPECT_EQ(moved.st_size, off_t{1} << 30);
  EXPECT_LT(moved.st_blocks * 512, off_t{4} << 20) << "the holes stayed holes";
  EXPECT_EQ(moved.st_mode & 07777, 0640u);
  EXPECT_FALSE(Exists(stage));

  // 100 MiB of data cannot fit: nothing is written, the staging stays whole.
  const std::string big = var + "/mobile/stage-fs/big";
  ASSERT_EQ(::mkdir(big.c_str(), 0755), 0);
  WriteFile(big + "/data", std::string(100 << 20, 'x'));
  EXPECT_EQ(Answer(sandbox_, "moveStagingToFinal:", XpcObject::String("/private/var/mobile/stage-fs/big")), false);
  EXPECT_EQ(Lstat(big + "/data").st_size, off_t{100} << 20);
  EXPECT_FALSE(Exists(var + "/backup")) << "the old backup went first, as always; no partial copy stands";
  EXPECT_NE(sandbox_.log().find("No space left on device"), std::string::npos);
  EXPECT_EQ(sandbox_.terminate(), 0);
}

}  // namespace
}  // namespace vtr::testing
