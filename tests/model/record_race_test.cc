// Records made while a client swaps a directory of the tree for a symbolic
// link: whatever is read must come from the directory the walk opened, never
// from where the link leads. The swap is made between opening the directory
// and making the record, so no timing is involved.
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cstring>

#include <gtest/gtest.h>

#include "model/file_hash.h"
#include "model/file_metadata.h"
#include "model/record_pipeline.h"
#include "model/tree_walker.h"
#include "platform/accounts.h"
#include "platform/file_manager.h"
#include "platform/file_tree.h"
#include "tests/support/failing_syscall.h"
#include "tests/support/test_support.h"

namespace vtr {
namespace {

using testing::IsRoot;
using testing::TempDir;
using testing::WriteFile;

Value DataOf(const std::string& text) { return Value::Data(text.data(), text.size()); }

uint64_t InodeOf(const std::string& path) {
  struct stat st;
  return ::lstat(path.c_str(), &st) == 0 ? st.st_ino : 0;
}

// dir/owned (what the walk opened) and dir/secret (what a client would have
// the helper read instead) hold items of the same names with different
// content: a file, a directory and a link, each with an extended attribute.
// swap() moves owned away to dir/moved and puts a link to secret in its place.
class SwappedTree {
 public:
  SwappedTree() {
    for (const char* side : {"owned", "secret"}) {
      const std::string base = dir_ / side;
      EXPECT_EQ(::mkdir(base.c_str(), 0755), 0);
      WriteFile(base + "/file", std::string("content of ") + side);
      EXPECT_EQ(::mkdir((base + "/sub").c_str(), 0755), 0);
      EXPECT_EQ(::symlink((std::string("target in ") + side).c_str(), (base + "/link").c_str()), 0);
      for (const char* item : {"/file", "/sub"}) {
        EXPECT_EQ(::setxattr((base + item).c_str(), "user.side", side, strlen(side), 0), 0) << "no user xattrs";
      }
      // Links take only trusted attributes, which root alone may set.
      if (IsRoot()) {
        EXPECT_EQ(::lsetxattr((base + "/link").c_str(), "trusted.side", side, strlen(side), 0), 0);
      }
    }
  }

  std::string owned() const { return dir_ / "owned"; }
  std::string moved() const { return dir_ / "moved"; }

  void swap() {
    ASSERT_EQ(::rename(owned().c_str(), moved().c_str()), 0);
    ASSERT_EQ(::symlink((dir_ / "secret").c_str(), owned().c_str()), 0);
  }

  // Checks that record, made for owned/name after the swap, describes the
  // item now at moved/name.
  void expectOriginal(const std::optional<VTRFileMetadata>& record, const std::string& name) const {
    SCOPED_TRACE(name);
    ASSERT_TRUE(record.has_value());
    const std::string original = moved() + "/" + name;
    EXPECT_EQ(record->getFileAttributes()->find(kNSFileSystemFileNumber)->unsignedInteger(), InodeOf(original));
    const Dictionary* xattrs = record->getExtendedAttributes();
    ASSERT_NE(xattrs, nullptr);
    if (name == "file") {
      EXPECT_EQ(record->dict().get(kVTRManifestFileHash), Value::Data(*fileHash(original)));
    }
    if (name == "link") {
      EXPECT_EQ(*record->getTargetFile(), "target in owned");
      const Value* side = xattrs->find("trusted.side");
      if (IsRoot()) {
        ASSERT_NE(side, nullptr);
        EXPECT_EQ(*side, DataOf("owned"));
      }
    } else {
      EXPECT_EQ(Value::DictionaryOf(*xattrs), Value::DictionaryOf({{"user.side", DataOf("owned")}}));
    }
  }

 private:
  TempDir dir_;
};

const char* const kItems[] = {"file", "sub", "link"};

TEST(RecordRaceTest, ARecordOfAnEntryIgnoresALinkSwappedInAboveIt) {
  SwappedTree tree;
  const UniqueFd dirFd(::open(tree.owned().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  ASSERT_TRUE(dirFd.valid());
  tree.swap();
  for (const char* name : kItems) {
    tree.expectOriginal(VTRFileMetadata::initWithItemAt(dirFd.get(), name, tree.owned() + "/" + name), name);
  }
  // The same path now leads into the other directory: the swap did take.
  const std::optional<VTRFileMetadata> byPath = VTRFileMetadata::initWithPath(tree.owned() + "/link");
  ASSERT_TRUE(byPath.has_value());
  EXPECT_EQ(*byPath->getTargetFile(), "target in secret");
}

// A fill hands the walk's directories to the record pipeline; the records
// are made (by take(), or by workers the items are published to there)
// after the walk has left the directory and the swap has been made.
TEST(RecordRaceTest, QueuedRecordsKeepTheDirectoryTheWalkOpened) {
  for (const unsigned threads : {0u, 2u}) {
    SCOPED_TRACE(threads);
    SwappedTree tree;
    RecordPipeline pipeline(threads, 16);
    TreeWalker walker(tree.owned(), [](const std::string& path, const Error&) { ADD_FAILURE() << path; });
    std::vector<std::string> names;
    while (walker.next()) {
      pipeline.submitRecord(walker.path(), walker.parentDirectory(), walker.name());
      names.push_back(walker.name());
    }
    ASSERT_EQ(names, (std::vector<std::string>{"file", "link", "sub"}));
    tree.swap();
    for (const std::string& name : names) {
      RecordPipeline::Item item = pipeline.take();
      EXPECT_EQ(item.path, tree.owned() + "/" + name);
      EXPECT_FALSE(item.directory) << "let go once the record is made";
      tree.expectOriginal(item.record, name);
    }
  }
}

TEST(RecordRaceTest, RecordsInFlightHoldABoundedNumberOfDirectories) {
  TempDir dir;
  WriteFile(dir / "file", "x");
  RecordPipeline pipeline(0, 100000);
  size_t submitted = 0;
  while (!pipeline.full()) {
    // Every item from a directory of its own, as in a tree of one file each.
    auto directory = std::make_shared<const UniqueFd>(::open(dir.path().c_str(), O_RDONLY | O_DIRECTORY));
    ASSERT_TRUE(directory->valid());
    pipeline.submitRecord(dir / "file", std::move(directory), "file");
    ++submitted;
  }
  EXPECT_EQ(submitted, RecordPipeline::kMaxDirectoriesInFlight);
  size_t taken = 0;
  while (pipeline.full()) {
    ASSERT_TRUE(pipeline.take().record.has_value());
    ++taken;
  }
  EXPECT_EQ(taken, RecordPipeline::kMaxDirectoriesInFlight / 2);
}

// On kernels without listxattrat and getxattrat, only a caller that names a
// path (a link's own attributes) is answered, by that path.
TEST(RecordRaceTest, ExtendedAttributesAtFallBackToThePathOnlyWhenGiven) {
  if (!testing::CanFailSyscalls()) GTEST_SKIP() << "no seccomp filter for this architecture";
  TempDir dir;
  WriteFile(dir / "file", "x");
  ASSERT_EQ(::setxattr((dir / "file").c_str(), "user.k", "value", 5, 0), 0) << "no user xattrs";
  const UniqueFd dirFd(::open(dir.path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  ASSERT_TRUE(dirFd.valid());
  const std::string path = dir / "file";
  const auto probe = [&](const std::string* fallback) {
    char list[64];
    char value[64];
    const ssize_t listed = ListExtendedAttributesAt(dirFd.get(), "file", list, sizeof list, fallback);
    const int listError = listed < 0 ? errno : 0;
    const ssize_t read = GetExtendedAttributeAt(dirFd.get(), "file", "user.k", value, sizeof value, fallback);
    const int readError = read < 0 ? errno : 0;
    return std::to_string(listed) + " " + std::to_string(listError) + " " +
           (read > 0 ? std::string(value, static_cast<size_t>(read)) : std::to_string(readError));
  };
  const std::vector<long> xattrAt = {464, 465};  // getxattrat, listxattrat
  const std::string direct = probe(nullptr);
  if (direct.rfind("-1 " + std::to_string(ENOSYS), 0) == 0) GTEST_SKIP() << "this kernel lacks listxattrat";
  EXPECT_EQ(direct, "7 0 value");
  EXPECT_EQ(testing::RunWithFailingSyscalls(xattrAt, ENOSYS, [&] { return probe(&path); }), "7 0 value");
  EXPECT_EQ(testing::RunWithFailingSyscalls(xattrAt, ENOSYS, [&] { return probe(nullptr); }),
            "-1 " + std::to_string(ENOSYS) + " " + std::to_string(ENOSYS));
}

}  // namespace
}  // namespace vtr
