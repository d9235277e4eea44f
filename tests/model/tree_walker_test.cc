// The tree walk under manifests: its order, what it refuses to follow or
// open, and how it gets past what it cannot walk (unreadable, too deep, too
// long, not text) without stopping.
#include "model/tree_walker.h"

#include <linux/limits.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "tests/model/manifest_test_support.h"
#include "tests/support/test_support.h"

namespace vtr {
namespace {

using testing::TempDir;
using testing::WriteFile;
using Type = TreeWalker::ItemType;

struct Walked {
  std::vector<std::pair<std::string, Type>> items;  // paths relative to the root
  std::vector<std::pair<std::string, int>> errors;  // relative path, errno
};

Walked Walk(const std::string& root, TreeWalker::SkipRule skip = nullptr) {
  Walked walked;
  const auto relative = [&root](const std::string& path) {
    return path.compare(0, root.size(), root) == 0 ? path.substr(root.size()) : path;
  };
  TreeWalker walker(
      root,
      [&](const std::string& path, const Error& error) { walked.errors.emplace_back(relative(path), error.code()); },
      std::move(skip));
  while (walker.next()) walked.items.emplace_back(relative(walker.path()), walker.type());
  return walked;
}

std::vector<std::string> Paths(const Walked& walked) {
  std::vector<std::string> paths;
  for (const auto& item : walked.items) paths.push_back(item.first);
  return paths;
}

void MakeSocket(const std::string& path) {
  const int fd = ::socket(AF_UNIX, SOCK_STREAM, 0);
  ASSERT_GE(fd, 0);
  struct sockaddr_un address = {};
  address.sun_family = AF_UNIX;
  ASSERT_LT(path.size(), sizeof address.sun_path);
  path.copy(address.sun_path, path.size());
  ASSERT_EQ(::bind(fd, reinterpret_cast<struct sockaddr*>(&address), sizeof address), 0);
  ::close(fd);
}

TEST(TreeWalkerTest, PreOrderInByteOrderWithEveryKindOfItem) {
  TempDir dir;
  ASSERT_EQ(::mkdir((dir / "b").c_str(), 0755), 0);
  ASSERT_EQ(::mkdir((dir / "b/inner").c_str(), 0755), 0);
  WriteFile(dir / "b/inner/deep", "x");
  WriteFile(dir / "B", "");
  WriteFile(dir / "a", "");
  WriteFile(dir / "\xc3\xa4", "");  // "ä": above every ASCII name
  WriteFile(dir / "b-", "");        // after b's contents, though "/b-" < "/b/..." as text
  ASSERT_EQ(::symlink("b", (dir / "link").c_str()), 0);
  ASSERT_EQ(::mkfifo((dir / "fifo").c_str(), 0600), 0);  // opening it would block the walk
  MakeSocket(dir / "sock");

  const Walked walked = Walk(dir.path());
  const std::vector<std::pair<std::string, Type>> expected = {
      {"/B", Type::kRegular},     {"/a", Type::kRegular},          {"/b", Type::kDirectory},
      {"/b/inner", Type::kDirectory}, {"/b/inner/deep", Type::kRegular}, {"/b-", Type::kRegular},
      {"/fifo", Type::kOther},    {"/link", Type::kSymbolicLink},  {"/sock", Type::kOther},
      {"/\xc3\xa4", Type::kRegular},
  };
  EXPECT_EQ(walked.items, expected);
  EXPECT_TRUE(walked.errors.empty());
}

TEST(TreeWalkerTest, NeverFollowsALink) {
  TempDir dir;
  ASSERT_EQ(::mkdir((dir / "tree").c_str(), 0755), 0);
  ASSERT_EQ(::mkdir((dir / "outside").c_str(), 0755), 0);
  WriteFile(dir / "outside/secret", "");
  ASSERT_EQ(::symlink("../outside", (dir / "tree/to-dir").c_str()), 0);
  ASSERT_EQ(::symlink(dir.path().c_str(), (dir / "tree/to-parent").c_str()), 0);

  Walked walked = Walk(dir / "tree");
  EXPECT_EQ(Paths(walked), (std::vector<std::string>{"/to-dir", "/to-parent"}));

  // A link as the root is reported, not entered.
  ASSERT_EQ(::symlink("outside", (dir / "root-link").c_str()), 0);
  walked = Walk(dir / "root-link");
  EXPECT_TRUE(walked.items.empty());
  EXPECT_EQ(walked.errors, (std::vector<std::pair<std::string, int>>{{"", ENOTDIR}}));
}

TEST(TreeWalkerTest, SkippedItemsAreNeitherYieldedNorEntered) {
  TempDir dir;
  for (const char* d : {"a", "a/b", "a/b/c", "a/bc"}) ASSERT_EQ(::mkdir((dir / d).c_str(), 0755), 0);
  WriteFile(dir / "a/b/c/f", "");
  std::vector<std::string> asked;
  const Walked walked = Walk(dir.path(), [&](const std::string& path) {
    asked.push_back(path);
    return path == dir / "a/b";
  });
  EXPECT_EQ(Paths(walked), (std::vector<std::string>{"/a", "/a/bc"}));
  EXPECT_EQ(asked, (std::vector<std::string>{dir / "a", dir / "a/b", dir / "a/bc"}));
}

TEST(TreeWalkerTest, MissingRootIsReportedOnce) {
  TempDir dir;
  const Walked walked = Walk(dir / "absent");
  EXPECT_TRUE(walked.items.empty());
  EXPECT_EQ(walked.errors, (std::vector<std::pair<std::string, int>>{{"", ENOENT}}));
}

TEST(TreeWalkerTest, UnreadableDirectoryIsReportedAndTheWalkGoesOn) {
  TempDir dir;
  ASSERT_EQ(::chmod(dir.path().c_str(), 0755), 0);
  for (const char* d : {"a", "locked", "z"}) ASSERT_EQ(::mkdir((dir / d).c_str(), 0755), 0);
  WriteFile(dir / "locked/hidden", "");
  WriteFile(dir / "z/after", "");
  ASSERT_EQ(::chmod((dir / "locked").c_str(), 0), 0);

  const std::string failure = testing::RunUnprivileged([&]() -> std::string {
    const Walked walked = Walk(dir.path());
    if (Paths(walked) != std::vector<std::string>{"/a", "/locked", "/z", "/z/after"}) return "wrong items";
    if (walked.errors != std::vector<std::pair<std::string, int>>{{"/locked", EACCES}}) return "wrong errors";
    return "";
  });
  EXPECT_EQ(failure, "");
}

TEST(TreeWalkerTest, DeepNestingStopsAtTheDepthLimit) {
  TempDir dir;
  testing::DirectoryChain chain(dir.path(), "d", 2 * kMaxWalkDepth + 100);
  ASSERT_TRUE(chain.made());
  WriteFile(dir / "e", "");

  const Walked walked = Walk(dir.path());

  // Levels 1..kMaxWalkDepth+1 are yielded; the last of them is not entered.
  ASSERT_EQ(walked.items.size(), kMaxWalkDepth + 2);
  EXPECT_EQ(walked.items.back().first, "/e");
  ASSERT_EQ(walked.errors.size(), 1u);
  EXPECT_EQ(walked.errors[0].first, walked.items[kMaxWalkDepth].first);
  EXPECT_EQ(walked.errors[0].first.size(), 2 * (kMaxWalkDepth + 1));
}

TEST(TreeWalkerTest, LongNamesWalkUntilThePathWouldReachPathMax) {
  TempDir dir;
  const std::string name(NAME_MAX, 'n');
  testing::DirectoryChain chain(dir.path(), name, PATH_MAX / (NAME_MAX + 1) + 2);
  ASSERT_TRUE(chain.made());
  WriteFile(dir / "z", "");

  const Walked walked = Walk(dir.path());

  ASSERT_FALSE(walked.items.empty());
  EXPECT_EQ(walked.items.back().first, "/z");
  for (const auto& item : walked.items) EXPECT_LT((dir.path() + item.first).size(), size_t{PATH_MAX});
  ASSERT_EQ(walked.errors.size(), 1u);
  EXPECT_EQ(walked.errors[0].second, ENAMETOOLONG);
  EXPECT_GE((dir.path() + walked.errors[0].first).size(), size_t{PATH_MAX});
  // The levels above the one reported, and "/z".
  const size_t reportedDepth = walked.errors[0].first.size() / (NAME_MAX + 1);
  EXPECT_EQ(walked.items.size(), reportedDepth);
}

TEST(TreeWalkerTest, NamesThatAreNotUtf8AreReportedNotYielded) {
  TempDir dir;
  ASSERT_EQ(::mkdir((dir / "bad\xff").c_str(), 0755), 0);
  WriteFile(dir / "bad\xff/inside", "");
  WriteFile(dir / "good", "");
  const Walked walked = Walk(dir.path());
  EXPECT_EQ(Paths(walked), (std::vector<std::string>{"/good"}));
  EXPECT_EQ(walked.errors, (std::vector<std::pair<std::string, int>>{{"/bad\xff", EILSEQ}}));
}

}  // namespace
}  // namespace vtr
