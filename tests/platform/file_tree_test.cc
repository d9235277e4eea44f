// The file manager's operations on whole items and trees: move (within and
// across file systems), link, removal, listing.
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cstdlib>

#include <gtest/gtest.h>

#include "platform/file_manager.h"
#include "platform/make_directories.h"
#include "tests/support/file_inspection.h"
#include "tests/support/test_support.h"

namespace vtr {
namespace {

using testing::Exists;
using testing::Lstat;
using testing::ReadFile;
using testing::RemoveTree;
using testing::TempDir;
using testing::WriteFile;
using testing::Xattr;

std::string LinkTarget(const std::string& path) {
  Result<std::string> target = DestinationOfSymbolicLink(path);
  if (target.ok()) return *target;
  std::string failed = "<";
  failed += target.error().description();
  failed += '>';
  return failed;
}

// A directory on another file system than TempDir's (tmpfs at /dev/shm), or
// an empty path when there is none.
class OtherFileSystemDir {
 public:
  explicit OtherFileSystemDir(const std::string& near) {
    std::string pattern = "/dev/shm/vtr-test-XXXXXX";
    struct stat a, b;
    if (::stat("/dev/shm", &a) != 0 || ::stat(near.c_str(), &b) != 0 || a.st_dev == b.st_dev) return;
    if (::mkdtemp(pattern.data()) != nullptr) path_ = pattern;
  }
  ~OtherFileSystemDir() {
    if (!path_.empty()) RemoveTree(path_);
  }
  const std::string& path() const { return path_; }
  std::string operator/(const std::string& relative) const { return path_ + "/" + relative; }

 private:
  std::string path_;
};

// source/
//   file        "data", mode 0640, mtime 1.5e9, xattr user.color=blue
//   sub/        mode 0750
//     deep      "deep"
//     out       -> <outside> (absolute link to a file outside the tree)
//   fifo
void MakeSampleTree(const std::string& root, const std::string& outside) {
  ASSERT_EQ(::mkdir(root.c_str(), 0755), 0);
  WriteFile(root + "/file", "data");
  ASSERT_EQ(::chmod((root + "/file").c_str(), 0640), 0);
  ASSERT_EQ(::setxattr((root + "/file").c_str(), "user.color", "blue", 4, 0), 0) << "no user xattrs here";
  const struct timespec times[2] = {{1500000000, 0}, {1500000000, 0}};
  ASSERT_EQ(::utimensat(AT_FDCWD, (root + "/file").c_str(), times, 0), 0);
  ASSERT_EQ(::mkdir((root + "/sub").c_str(), 0750), 0);
  WriteFile(root + "/sub/deep", "deep");
  ASSERT_EQ(::symlink(outside.c_str(), (root + "/sub/out").c_str()), 0);
  ASSERT_EQ(::mkfifo((root + "/fifo").c_str(), 0600), 0);
}

TEST(MoveItemTest, RenamesWithinAFileSystemAndNeverReplaces) {
  TempDir dir;
  WriteFile(dir / "a", "A");
  WriteFile(dir / "b", "B");
  ASSERT_EQ(::symlink("nowhere", (dir / "dangling").c_str()), 0);

  EXPECT_EQ(MoveItem(dir / "a", dir / "b").error().code(), EEXIST);
  EXPECT_EQ(MoveItem(dir / "a", dir / "dangling").error().code(), EEXIST);
  EXPECT_EQ(ReadFile(dir / "a"), "A");
  EXPECT_EQ(ReadFile(dir / "b"), "B");

  ASSERT_TRUE(MoveItem(dir / "a", dir / "c").ok());
  EXPECT_FALSE(Exists(dir / "a"));
  EXPECT_EQ(ReadFile(dir / "c"), "A");
  EXPECT_EQ(MoveItem(dir / "a", dir / "d").error().code(), ENOENT);
}

TEST(MoveItemTest, CopiesATreeAcrossFileSystemsWithoutFollowingLinks) {
  TempDir dir;
  OtherFileSystemDir other(dir.path());
  if (other.path().empty()) GTEST_SKIP() << "no second file system (tmpfs at /dev/shm) to move to";
  WriteFile(dir / "outside", "secret");
  MakeSampleTree(dir / "source", dir / "outside");
  const struct stat fileBefore = Lstat(dir / "source/file");

  Status moved = MoveItem(dir / "source", other / "moved");
  ASSERT_TRUE(moved.ok()) << moved.error().description();
  EXPECT_FALSE(Exists(dir / "source"));
  EXPECT_EQ(ReadFile(dir / "outside"), "secret");

  EXPECT_EQ(ReadFile(other / "moved/file"), "data");
  const struct stat file = Lstat(other / "moved/file");
  EXPECT_EQ(file.st_mode & 07777, 0640u);
  EXPECT_EQ(file.st_uid, fileBefore.st_uid);
  EXPECT_EQ(file.st_mtim.tv_sec, 1500000000);
  EXPECT_EQ(Xattr(other / "moved/file", "user.color"), "blue");
  EXPECT_EQ(Lstat(other / "moved/sub").st_mode & 07777, 0750u);
  EXPECT_EQ(ReadFile(other / "moved/sub/deep"), "deep");
  EXPECT_TRUE(S_ISLNK(Lstat(other / "moved/sub/out").st_mode));
  EXPECT_EQ(LinkTarget(other / "moved/sub/out"), dir / "outside");
  EXPECT_TRUE(S_ISFIFO(Lstat(other / "moved/fifo").st_mode));

  // Across file systems too, an existing destination is never replaced.
  WriteFile(dir / "again", "again");
  EXPECT_EQ(MoveItem(dir / "again", other / "moved").error().code(), EEXIST);
  EXPECT_EQ(ReadFile(dir / "again"), "again");
  EXPECT_EQ(ReadFile(other / "moved/file"), "data");
}

TEST(MoveItemTest, AFailedCopyLeavesNothingBehindAndTheSourceWhole) {
  TempDir dir;
  OtherFileSystemDir other(dir.path());
  if (other.path().empty()) GTEST_SKIP() << "no second file system (tmpfs at /dev/shm) to move to";
  // One level deeper than a tree walk may go.
  std::string deepest = dir / "deep";
  ASSERT_EQ(::mkdir(deepest.c_str(), 0755), 0);
  for (int i = 0; i < kMaxTreeDepth; ++i) {
    deepest += "/d";
    ASSERT_EQ(::mkdir(deepest.c_str(), 0755), 0);
  }
  WriteFile(deepest + "/leaf", "leaf");

  Status moved = MoveItem(dir / "deep", other / "deep");
  ASSERT_FALSE(moved.ok());
  EXPECT_EQ(moved.error().code(), ELOOP);
  EXPECT_FALSE(Exists(other / "deep"));
  EXPECT_EQ(ReadFile(deepest + "/leaf"), "leaf");
}

TEST(LinkItemTest, LinksFilesAndRecreatesDirectoriesAndLinks) {
  TempDir dir;
  WriteFile(dir / "outside", "secret");
  MakeSampleTree(dir / "source", dir / "outside");
  ASSERT_EQ(::mkdir((dir / "staging").c_str(), 0755), 0);

  Status linked = LinkItem(dir / "source", dir / "staging/tree");
  ASSERT_TRUE(linked.ok()) << linked.error().description();
  EXPECT_EQ(Lstat(dir / "staging/tree/file").st_ino, Lstat(dir / "source/file").st_ino);
  EXPECT_EQ(Lstat(dir / "staging/tree/sub/deep").st_ino, Lstat(dir / "source/sub/deep").st_ino);
  EXPECT_EQ(Lstat(dir / "staging/tree/fifo").st_ino, Lstat(dir / "source/fifo").st_ino);
  EXPECT_NE(Lstat(dir / "staging/tree/sub").st_ino, Lstat(dir / "source/sub").st_ino);
  EXPECT_EQ(Lstat(dir / "staging/tree/sub").st_mode & 07777, 0750u);
  // The link is recreated, not followed: the outside file gets no new name.
  EXPECT_TRUE(S_ISLNK(Lstat(dir / "staging/tree/sub/out").st_mode));
  EXPECT_NE(Lstat(dir / "staging/tree/sub/out").st_ino, Lstat(dir / "source/sub/out").st_ino);
  EXPECT_EQ(LinkTarget(dir / "staging/tree/sub/out"), dir / "outside");
  EXPECT_EQ(Lstat(dir / "outside").st_nlink, 1u);

  // A single file; an existing destination; a link at the source.
  ASSERT_TRUE(LinkItem(dir / "outside", dir / "staging/one").ok());
  EXPECT_EQ(Lstat(dir / "outside").st_nlink, 2u);
  EXPECT_EQ(LinkItem(dir / "source/sub/deep", dir / "staging/one").error().code(), EEXIST);
  EXPECT_EQ(ReadFile(dir / "staging/one"), "secret");
  ASSERT_TRUE(LinkItem(dir / "source/sub/out", dir / "staging/link").ok());
  EXPECT_EQ(LinkTarget(dir / "staging/link"), dir / "outside");
  EXPECT_EQ(Lstat(dir / "outside").st_nlink, 2u);
}

TEST(LinkItemTest, FailsAcrossFileSystemsAndCleansUp) {
  TempDir dir;
  OtherFileSystemDir other(dir.path());
  if (other.path().empty()) GTEST_SKIP() << "no second file system (tmpfs at /dev/shm) to link to";
  WriteFile(dir / "outside", "x");
  MakeSampleTree(dir / "source", dir / "outside");
  Status linked = LinkItem(dir / "source", other / "tree");
  ASSERT_FALSE(linked.ok());
  EXPECT_EQ(linked.error().code(), EXDEV);
  EXPECT_FALSE(Exists(other / "tree"));
}

TEST(RemoveItemTest, RemovesALinkToOutsideButNotWhatItNames) {
  TempDir dir;
  ASSERT_EQ(::mkdir((dir / "outside").c_str(), 0755), 0);
  WriteFile(dir / "outside/keep", "keep");
  ASSERT_EQ(::mkdir((dir / "tree").c_str(), 0755), 0);
  ASSERT_EQ(::symlink((dir / "outside").c_str(), (dir / "tree/dirlink").c_str()), 0);
  ASSERT_EQ(::symlink((dir / "outside/keep").c_str(), (dir / "tree/filelink").c_str()), 0);

  ASSERT_TRUE(RemoveItem(dir / "tree").ok());
  EXPECT_FALSE(Exists(dir / "tree"));
  EXPECT_EQ(ReadFile(dir / "outside/keep"), "keep");
}

TEST(FileManagerTest, ListsAndReadsLinksWithoutFollowingThem) {
  TempDir dir;
  ASSERT_TRUE(MakeDirectories(dir / "a/b").ok());
  WriteFile(dir / "a/zz", "");
  WriteFile(dir / "a/.hidden", "");
  ASSERT_EQ(::symlink("a", (dir / "alink").c_str()), 0);

  Result<std::vector<std::string>> names = ContentsOfDirectory(dir / "a");
  ASSERT_TRUE(names.ok());
  EXPECT_EQ(*names, (std::vector<std::string>{".hidden", "b", "zz"}));
  EXPECT_FALSE(ContentsOfDirectory(dir / "alink").ok()) << "a link at the path must not be followed";
  EXPECT_EQ(ContentsOfDirectory(dir / "a/zz").error().code(), ENOTDIR);

  EXPECT_EQ(LinkTarget(dir / "alink"), "a");
  EXPECT_EQ(DestinationOfSymbolicLink(dir / "a").error().code(), EINVAL);
}

}  // namespace
}  // namespace vtr
