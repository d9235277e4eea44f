#include "model/log_model.h"

#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cstdlib>
#include <ctime>
#include <regex>

#include <gtest/gtest.h>

#include "model/log.h"
#include "platform/file_dates.h"
#include "platform/unique_fd.h"
#include "tests/support/failing_syscall.h"
#include "tests/support/test_support.h"

namespace vtr {
namespace {

using testing::ReadFile;
using testing::TempDir;
using testing::WriteFile;

constexpr double kDay = 86400;

bool Exists(const std::string& path) {
  struct stat st;
  return ::lstat(path.c_str(), &st) == 0;
}

// A model with a memory system log and a clock the test sets; the test owns
// the stream it opens.
class LogModelTest : public ::testing::Test {
 protected:
  LogModelTest()
      : systemLog_(std::make_shared<MemorySystemLog>()),
        clock_(std::make_shared<FixedClock>(Date{0})),
        model_(systemLog_, clock_) {
    ::setenv("TZ", "UTC", 1);
    ::tzset();
  }
  ~LogModelTest() override {
    if (model_.logFP() != nullptr) std::fclose(model_.logFP());
  }

  // Today's log file for the fixed clock.
  std::string todaysFile() const { return model_.fileNameForTodayUnder(dir_.path(), "vitd_helper"); }

  TempDir dir_;
  std::shared_ptr<MemorySystemLog> systemLog_;
  std::shared_ptr<FixedClock> clock_;
  VTRLogModel model_;
};

TEST_F(LogModelTest, WithoutFileOnlyTheSystemLogGetsTheBareMessageWithItsPriority) {
  model_.logWithFormat(LogPriority::kError, "Couldn't move %@ to %@", std::string("/a"), std::string("/b"));
  model_.logWithFormat(LogPriority::kNotice, "Entering %s", "x");
  EXPECT_FALSE(model_.logToFileEnabled());
  EXPECT_EQ(systemLog_->messages(), (std::vector<std::string>{"Couldn't move /a to /b", "Entering x"}));
  EXPECT_EQ(systemLog_->errors(), std::vector<std::string>{"Couldn't move /a to /b"});
}

TEST_F(LogModelTest, AJournalErrorReachesTheSystemLogAsAFailureButNeverTheDayFile) {
  clock_->set(Date::FromUnix(1795253400));
  ASSERT_TRUE(model_.enableLogToFile(dir_ / "x.log"));
  const uint64_t before = VTRLogModel::failuresLoggedOnThisThread();
  model_.logMessage("why", LogPriority::kJournalError);
  model_.logMessage("told", LogPriority::kNotice);
  EXPECT_EQ(ReadFile(dir_ / "x.log"), "2026-11-21 09:30:00 +0000 told\n");
  EXPECT_EQ(systemLog_->errors(), std::vector<std::string>{"why"});
  EXPECT_EQ(VTRLogModel::failuresLoggedOnThisThread(), before + 1);
}

TEST_F(LogModelTest, FileLinesCarryTheUtcDateAndKeepATrailingNewline) {
  clock_->set(Date::FromUnix(1795253400));  // 2026-11-21 09:30:00 UTC
  ASSERT_TRUE(model_.enableLogToFile(dir_ / "x.log"));
  model_.logMessage("first");
  model_.logMessage("ends with newline\n");
  model_.logMessage("after");
  EXPECT_EQ(ReadFile(dir_ / "x.log"),
            "2026-11-21 09:30:00 +0000 first\n"
            "2026-11-21 09:30:00 +0000 ends with newline\n\n"
            "2026-11-21 09:30:00 +0000 after\n");
  // The system log copy has no time stamp.
  EXPECT_EQ(systemLog_->messages().front(), "first");
}

TEST_F(LogModelTest, AnExistingFileIsAppendedToNeverTruncated) {
  clock_->set(Date::FromUnix(1795253400));
  // A fragment an earlier run could not cut off (a kill, a power cut)
  // ends before the first line of this one.
  for (const std::string earlier : {"earlier run\n", "earlier run\nfragm"}) {
    WriteFile(todaysFile(), earlier);
    ASSERT_TRUE(model_.enableLogToFilesUnder(dir_.path(), "vitd_helper", 5));
    model_.logMessage("restarted");
    EXPECT_EQ(ReadFile(todaysFile()), earlier + (earlier.back() == '\n' ? "" : "\n") +
                                          "2026-11-21 09:30:00 +0000 restarted\n");
    std::fclose(model_.logFP());
    model_.setLogFP(nullptr);
  }
}

TEST_F(LogModelTest, AFullDiskCutsNoLineInTwo) {
  if (!testing::IsRoot()) GTEST_SKIP() << "mounts a small tmpfs: needs root";
  const std::string small = dir_ / "small";
  ASSERT_EQ(::mkdir(small.c_str(), 0755), 0);
  testing::TmpfsMount mount(small, "64k");
  ASSERT_TRUE(mount.ok());
  clock_->set(Date::FromUnix(1795253400));
  const struct {
    const char* what;
    std::vector<long> failing;  // system calls made to fail
    std::string left;           // what the file holds after the disk had room again
  } cases[] = {
      {"the fragment is cut off", {}, "D before\nD short\nD after\n"},
      {"a fragment that stays ends at the next line", {SYS_ftruncate}, "D before\nD FRAGMENT\nD after\n"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.what);
    const std::string file = small + "/x.log";
    ::unlink(file.c_str());
    const std::string left = testing::RunWithFailingSyscalls(c.failing, EIO, [&] {
      if (!model_.enableLogToFile(file)) return std::string("<not enabled>");
      model_.logMessage("before");
      // The rest of the disk taken, but for the file's own first page.
      UniqueFd filler(::open((small + "/filler").c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600));
      const std::string page(4096, 'f');
      while (::write(filler.get(), page.data(), page.size()) > 0) {
      }
      filler.reset();
      model_.logMessage(std::string(3 * 4096, 'x'));  // fits only in part
      model_.logMessage("short");  // fits where a fragment was cut off, if it was
      ::unlink((small + "/filler").c_str());
      model_.logMessage("after");
      return ReadFile(file);
    });
    // The date stands as "D", a fragment as "FRAGMENT".
    std::string shown = std::regex_replace(left, std::regex("2026-11-21 09:30:00 \\+0000"), "D");
    shown = std::regex_replace(shown, std::regex("x{16,}"), "FRAGMENT");
    EXPECT_EQ(shown, c.left);
  }
}

TEST_F(LogModelTest, FileNameOfTheDayPadsTheYearWithSpaces) {
  clock_->set(Date::FromUnix(UnixFromCivil(CivilTime{2026, 3, 7, 12, 0, 0})));
  EXPECT_EQ(model_.fileNameForTodayUnder("/private/var/logs/vitd", "vitd_helper"),
            "/private/var/logs/vitd/vitd_helper-20260307.log");
  clock_->set(Date::FromUnix(UnixFromCivil(CivilTime{999, 12, 31, 12, 0, 0})));
  EXPECT_EQ(model_.fileNameForTodayUnder("/d", "p"), "/d/p- 9991231.log");
}

TEST_F(LogModelTest, ParentDirectoryIsCreatedAndTheProbeNeverStays) {
  const std::string logs = dir_ / "private/var/logs/vitd";
  clock_->set(Date::FromUnix(1795253400));
  ASSERT_TRUE(model_.enableLogToFilesUnder(logs, "vitd_helper", 5));
  EXPECT_TRUE(model_.logToFileEnabled());
  EXPECT_FALSE(Exists(logs + "/testWritability.log"));
  EXPECT_TRUE(Exists(logs + "/vitd_helper-20261121.log"));
}

TEST_F(LogModelTest, ExpirySweepHonoursTheCutOffToTheSecond) {
  WriteFile(dir_ / "old.log", "x");
  ASSERT_EQ(::mkdir((dir_ / "oldsub").c_str(), 0755), 0);
  WriteFile(dir_ / "oldsub/inner", "x");
  const Date created = *CreationDateOfItem(dir_ / "oldsub");
  const Date fileCreated = *CreationDateOfItem(dir_ / "old.log");
  const Date newest = std::max(created, fileCreated);
  const Date oldest = std::min(created, fileCreated);

  // 4 days 23 hours after creation: everything stays.
  clock_->set(Date{oldest.secondsSince2001 + 4 * kDay + 23 * 3600});
  ASSERT_TRUE(model_.enableLogToFilesUnder(dir_.path(), "vitd_helper", 5));
  EXPECT_TRUE(Exists(dir_ / "old.log"));
  EXPECT_TRUE(Exists(dir_ / "oldsub/inner"));
  std::fclose(model_.logFP());
  model_.setLogFP(nullptr);

  // 5 days and 1 second after creation: the file goes, and the subdirectory
  // with its contents. Today's log file, just created, stays.
  clock_->set(Date{newest.secondsSince2001 + 5 * kDay + 1});
  ASSERT_TRUE(model_.enableLogToFilesUnder(dir_.path(), "vitd_helper", 5));
  EXPECT_FALSE(Exists(dir_ / "old.log"));
  EXPECT_FALSE(Exists(dir_ / "oldsub"));
  EXPECT_TRUE(Exists(todaysFile()));
  EXPECT_TRUE(systemLog_->contains(Format("Removing %@ whose creation date is %@.", dir_ / "old.log", fileCreated)));
  const Date cutoff{clock_->now().secondsSince2001 - 5 * kDay};
  EXPECT_TRUE(systemLog_->contains(
      Format("Checking existing log file (full path) %@ against %@", dir_ / "old.log", cutoff)));
}

TEST_F(LogModelTest, UnwritableDirectoryLeavesFileLoggingOff) {
  const std::string logs = dir_ / "logs";
  ASSERT_EQ(::mkdir(logs.c_str(), 0755), 0);
  // Root writes through permission bits, so an immutable directory stands in.
  bool madeReadOnly = false;
  if (testing::IsRoot()) {
    const int fd = ::open(logs.c_str(), O_RDONLY | O_DIRECTORY);
    int flags = 0;
    if (fd >= 0 && ::ioctl(fd, FS_IOC_GETFLAGS, &flags) == 0) {
      flags |= FS_IMMUTABLE_FL;
      madeReadOnly = ::ioctl(fd, FS_IOC_SETFLAGS, &flags) == 0;
    }
    if (fd >= 0) ::close(fd);
  } else {
    madeReadOnly = ::chmod(logs.c_str(), 0555) == 0;
  }
  if (!madeReadOnly) GTEST_SKIP() << "cannot make a directory unwritable on this file system";

  const bool enabled = model_.enableLogToFilesUnder(logs, "vitd_helper", 5);
  model_.logMessage("still reaches the system log");

  if (testing::IsRoot()) {
    const int fd = ::open(logs.c_str(), O_RDONLY | O_DIRECTORY);
    int flags = 0;
    ::ioctl(fd, FS_IOC_GETFLAGS, &flags);
    flags &= ~FS_IMMUTABLE_FL;
    ::ioctl(fd, FS_IOC_SETFLAGS, &flags);
    ::close(fd);
  }
  EXPECT_FALSE(enabled);
  EXPECT_FALSE(model_.logToFileEnabled());
  EXPECT_TRUE(systemLog_->contains("still reaches the system log"));
}

TEST_F(LogModelTest, UncreatableDirectoryFailsWithoutTouchingTheStream) {
  WriteFile(dir_ / "file", "x");
  EXPECT_FALSE(model_.enableLogToFilesUnder(dir_ / "file/logs", "vitd_helper", 5));
  EXPECT_FALSE(model_.enableLogToFile(dir_ / "file/logs/x.log"));
  EXPECT_EQ(model_.logFP(), nullptr);
}

TEST(CreationDateTest, BirthTimeWhereRecordedElseModificationTime) {
  struct statx stx = {};
  stx.stx_mtime.tv_sec = 2000000000;
  stx.stx_btime.tv_sec = 1000000000;
  stx.stx_mask = STATX_MTIME;
  EXPECT_EQ(CreationDateFromStatx(stx), Date::FromUnix(2000000000));
  stx.stx_mask = STATX_MTIME | STATX_BTIME;
  EXPECT_EQ(CreationDateFromStatx(stx), Date::FromUnix(1000000000));
}

TEST(LogFunctionTest, DebugLogEmitsNothing) {
  testing::LogCapture capture;
  VTRDebugLog("Checking the type");
  VTRLog("It reached %s", "the system log");
  EXPECT_EQ(capture.messages(), std::vector<std::string>{"It reached the system log"});
}

}  // namespace
}  // namespace vtr
