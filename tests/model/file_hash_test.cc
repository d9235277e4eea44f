#include "model/file_hash.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cstdio>

#include <gtest/gtest.h>

#include "tests/support/failing_syscall.h"
#include "tests/support/test_support.h"

namespace vtr {
namespace {

using testing::LogCapture;
using testing::TempDir;
using testing::WriteFile;

std::string Hex(const Bytes& bytes) {
  static const char kDigits[] = "0123456789abcdef";
  std::string hex;
  for (uint8_t b : bytes) {
    hex += kDigits[b >> 4];
    hex += kDigits[b & 15];
  }
  return hex;
}

std::string HashHex(const std::string& path) {
  std::optional<Bytes> hash = fileHash(path);
  return hash ? Hex(*hash) : "<absent>";
}

// The digest as an independent implementation (coreutils) computes it.
std::string Sha1sum(const std::string& path) {
  const std::string command = "sha1sum < '" + path + "'";
  FILE* pipe = ::popen(command.c_str(), "r");
  if (pipe == nullptr) return "<sha1sum failed>";
  char line[128] = {};
  const bool read = std::fgets(line, sizeof line, pipe) != nullptr;
  ::pclose(pipe);
  return read ? std::string(line, 40) : "<sha1sum failed>";
}

TEST(FileHashTest, MatchesPublishedVectors) {
  TempDir dir;
  const struct {
    std::string content;
    const char* digest;
  } vectors[] = {
      {"", "da39a3ee5e6b4b0d3255bfef95601890afd80709"},
      {"abc", "a9993e364706816aba3e25717850c26c9cd0d89d"},
      {"abcdbcdecdefdefgefghfghighijhijkijkljklmklmnlmnomnopnopq", "84983e441c3bd26ebaae4aa1f95129e5e54670f1"},
      // Four full chunks and part of a fifth.
      {std::string(1000000, 'a'), "34aa973cd4c4daa4f61eeb2bdbad27316534016f"},
  };
  for (const auto& v : vectors) {
    WriteFile(dir / "f", v.content);
    EXPECT_EQ(HashHex(dir / "f"), v.digest) << v.content.size() << " bytes";
  }
}

TEST(FileHashTest, ChunkBoundariesHashLikeAnIndependentImplementation) {
  TempDir dir;
  for (size_t size : {size_t{0}, size_t{1}, kFileHashChunkBytes - 1, kFileHashChunkBytes, kFileHashChunkBytes + 1,
                      2 * kFileHashChunkBytes}) {
    std::string content(size, '\0');
    for (size_t i = 0; i < size; ++i) content[i] = static_cast<char>((i * 131 + i / 7) & 0xff);
    WriteFile(dir / "f", content);
    std::optional<Bytes> hash = fileHash(dir / "f");
    ASSERT_TRUE(hash.has_value()) << size;
    EXPECT_EQ(hash->size(), kFileHashDigestBytes);
    EXPECT_EQ(Hex(*hash), Sha1sum(dir / "f")) << size << " bytes";
  }
}

TEST(FileHashTest, RefusesWhatIsNotARegularFileWithoutBlocking) {
  TempDir dir;
  WriteFile(dir / "file", "abc");
  ASSERT_EQ(::symlink("file", (dir / "link").c_str()), 0);
  ASSERT_EQ(::mkfifo((dir / "fifo").c_str(), 0600), 0);
  ASSERT_EQ(::mkdir((dir / "dir").c_str(), 0700), 0);
  for (const std::string& path : {dir / "missing", dir / "link", dir / "fifo", dir / "dir"}) {
    LogCapture log;
    EXPECT_FALSE(fileHash(path).has_value()) << path;
    EXPECT_EQ(log.messages(), std::vector<std::string>{"Cannot read file " + path});
  }
}

TEST(FileHashTest, AReadErrorIsReportedOnce) {
  // A file whose reads fail: pread made to fail with EIO in a child.
  if (!testing::CanFailSyscalls()) GTEST_SKIP() << "no seccomp filter for this architecture";
  TempDir dir;
  WriteFile(dir / "f", "content");
  const std::string path = dir / "f";
  const std::string outcome = testing::RunWithFailingSyscalls({SYS_pread64}, EIO, [&path] {
    LogCapture log;
    const bool hashed = fileHash(path).has_value();
    const std::vector<std::string> messages = log.messages();
    return std::string(hashed ? "hashed" : "failed") + (messages.empty() ? "" : ": " + messages[0]) +
           (messages.size() > 1 ? " and more" : "");
  });
  EXPECT_EQ(outcome, "failed: Cannot read data from " + path + ".");
}

TEST(FileHashTest, AFileIsReadNoFurtherThanItsSizeAtOpen) {
  // /proc/self/mem says it is empty but would read on: it hashes as empty.
  const std::string path = "/proc/self/mem";
  if (::access(path.c_str(), R_OK) != 0) GTEST_SKIP() << path << " is not readable here";
  TempDir dir;
  WriteFile(dir / "empty", "");
  EXPECT_EQ(fileHash(path), fileHash(dir / "empty"));
}

TEST(FileHashTest, LeavesTheAccessTimeAloneAndDirectoriesUnhashed) {
  TempDir dir;
  WriteFile(dir / "f", "content");
  // Old enough that any atime policy but noatime would update it on a read.
  const struct timespec times[2] = {{1000000000, 0}, {1000000000, 0}};
  ASSERT_EQ(::utimensat(AT_FDCWD, (dir / "f").c_str(), times, 0), 0);
  ASSERT_TRUE(fileHash(dir / "f").has_value());
  struct stat st;
  ASSERT_EQ(::stat((dir / "f").c_str(), &st), 0);
  EXPECT_EQ(st.st_atim.tv_sec, 1000000000);
  EXPECT_FALSE(directoryHash(dir.path()).has_value());
}

}  // namespace
}  // namespace vtr
