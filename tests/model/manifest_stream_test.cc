// A manifest streamed to a file by worker threads must be the file a
// sequential fill writes, byte for byte, with the same log; and the file
// must hold what the manifest's dictionary holds.
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <random>

#include <gtest/gtest.h>

#include "model/manifest.h"
#include "model/manifest_file.h"
#include "platform/file_manager.h"
#include "platform/plist.h"
#include "tests/support/test_support.h"

namespace vtr {
namespace {

using testing::LogCapture;
using testing::TempDir;
using testing::WriteFile;

// A reproducible tree of nested directories with files of every size class
// (empty, a few bytes, around the 256 KiB read size, several MiB), links
// (dangling too), extended attributes, fifos, and an entry the walk reports
// (a name that is not UTF-8), so that ordering has work to get wrong.
void MakeTree(const std::string& root) {
  std::mt19937 random(20240601);
  std::vector<std::string> dirs = {root};
  for (int i = 0; i < 60; ++i) {
    const std::string dir = dirs[random() % dirs.size()] + "/d" + std::to_string(i);
    ASSERT_EQ(::mkdir(dir.c_str(), 0755), 0);
    dirs.push_back(dir);
  }
  const size_t sizes[] = {0, 1, 100, 4096, 262143, 262144, 262145, 3 << 20};
  for (int i = 0; i < 600; ++i) {
    const std::string path = dirs[random() % dirs.size()] + "/f" + std::to_string(i);
    const size_t size = i % 50 == 0 ? sizes[random() % 8] : random() % 20000;
    std::string content(size, '\0');
    for (char& c : content) c = static_cast<char>(random());
    WriteFile(path, content);
    if (i % 7 == 0) {
      const std::string value = std::to_string(i);
      ASSERT_EQ(::setxattr(path.c_str(), "user.test", value.data(), value.size(), 0), 0);
    }
    if (i % 13 == 0) {
      ASSERT_EQ(::symlink(i % 2 ? "nowhere" : path.c_str(), (path + ".link").c_str()), 0);
    }
    if (i % 97 == 0) {
      ASSERT_EQ(::mkfifo((path + ".fifo").c_str(), 0600), 0);
    }
  }
  WriteFile(dirs[5] + "/odd\xfe", "");
}

struct StreamedFill {
  bool filled = false;
  Bytes file;
  std::vector<std::string> log;
};

StreamedFill FillToFile(const std::string& tree, unsigned threads, const std::string& output) {
  StreamedFill result;
  LogCapture log;
  Result<std::unique_ptr<ManifestFileWriter>> writer = ManifestFileWriter::Create(output);
  EXPECT_TRUE(writer.ok());
  if (!writer.ok()) return result;
  VTRManifest manifest;
  manifest.setRecordThreads(threads);
  VTRProgressUpdater updater;
  manifest.setProgressUpdater(&updater);
  result.filled = manifest.enumerateAndCollectMetaData(tree, tree, {}, true, (*writer)->handler());
  EXPECT_TRUE((*writer)->commit().ok());
  const std::string bytes = testing::ReadFile(output);
  result.file.assign(bytes.begin(), bytes.end());
  result.log = log.messages();
  return result;
}

TEST(ManifestStreamTest, WorkersWriteTheSequentialFileAndLog) {
  TempDir dir;
  ASSERT_EQ(::mkdir((dir / "tree").c_str(), 0755), 0);
  MakeTree(dir / "tree");
  ASSERT_FALSE(::testing::Test::HasFatalFailure());

  const StreamedFill sequential = FillToFile(dir / "tree", 0, dir / "sequential.plist");
  ASSERT_TRUE(sequential.filled);
  ASSERT_GT(sequential.file.size(), 100000u);
  for (const unsigned threads : {1u, 2u, 4u}) {
    SCOPED_TRACE(threads);
    const StreamedFill parallel = FillToFile(dir / "tree", threads, dir / "parallel.plist");
    EXPECT_TRUE(parallel.filled);
    EXPECT_TRUE(parallel.file == sequential.file);
    EXPECT_EQ(parallel.log, sequential.log);
  }
  // The log has the lines that ordering could have mixed up.
  size_t special = 0, unwalkableInWalk = 0, unwalkableInTotal = 0, percents = 0;
  for (const std::string& line : sequential.log) {
    special += line.find("is special file") != std::string::npos;
    unwalkableInWalk += line.rfind("__77-[VTRManifest enumerateAndCollectMetaData:", 0) == 0;
    unwalkableInTotal += line.rfind("__48-[VTRManifest calculateTotalFileSize:", 0) == 0;
    percents += line.rfind("Percentage increased to ", 0) == 0;
  }
  EXPECT_EQ(special, 7u);
  EXPECT_EQ(unwalkableInWalk, 1u);
  EXPECT_EQ(unwalkableInTotal, 1u);
  EXPECT_GT(percents, 10u);
}

TEST(ManifestStreamTest, TheFileHoldsTheManifestsDictionary) {
  TempDir dir;
  ASSERT_EQ(::mkdir((dir / "tree").c_str(), 0755), 0);
  MakeTree(dir / "tree");
  ASSERT_FALSE(::testing::Test::HasFatalFailure());
  const StreamedFill streamed = FillToFile(dir / "tree", 2, dir / "streamed.plist");
  ASSERT_TRUE(streamed.filled);

  VTRManifest manifest;
  ASSERT_TRUE(manifest.addFilesFromPath(dir / "tree", dir / "tree", {}, true));
  Result<Value> read = ReadPropertyList(streamed.file);
  ASSERT_TRUE(read.ok()) << read.error().description();
  EXPECT_EQ(*read, manifest.dict());
  EXPECT_EQ(manifest.count(), 600u + 60u + 47u + 1u);  // files, directories, links, the tree
}

TEST(ManifestStreamTest, AFailedFillLeavesTheEarlierFile) {
  TempDir dir;
  WriteFile(dir / "f", "");
  WriteFile(dir / "manifest.plist", "earlier");
  Result<std::unique_ptr<ManifestFileWriter>> writer = ManifestFileWriter::Create(dir / "manifest.plist");
  ASSERT_TRUE(writer.ok());
  VTRManifest manifest;
  const VTRManifest::Handler add = (*writer)->handler();
  EXPECT_FALSE(manifest.enumerateAndCollectMetaData(dir.path(), dir.path(), {}, false,
                                                    [&](const VTRFileMetadata& record, const std::string& key) {
                                                      add(record, key);
                                                      return false;
                                                    }));
  writer->reset();  // never committed
  EXPECT_EQ(testing::ReadFile(dir / "manifest.plist"), "earlier");
  Result<std::vector<std::string>> names = ContentsOfDirectory(dir.path());
  ASSERT_TRUE(names.ok());
  EXPECT_EQ(*names, (std::vector<std::string>{"f", "manifest.plist"}));  // no temporary file left
}

TEST(ManifestStreamTest, AFileWrittenInsideTheTreeHoldsTheTreeAsItWasBefore) {
  TempDir dir;
  WriteFile(dir / "f", "content");
  WriteFile(dir / "manifest.plist", "earlier");
  const Value earlier = VTRFileMetadata::fileMetadatatWithPath(dir / "manifest.plist")->dict();
  Result<std::unique_ptr<ManifestFileWriter>> writer = ManifestFileWriter::Create(dir / "manifest.plist");
  ASSERT_TRUE(writer.ok());
  VTRManifest manifest;
  ASSERT_TRUE(manifest.enumerateAndCollectMetaData(dir.path(), dir.path(), {}, false, (*writer)->handler()));
  ASSERT_TRUE((*writer)->commit().ok());

  Result<Value> read = ReadPropertyListFile(dir / "manifest.plist");
  ASSERT_TRUE(read.ok()) << read.error().description();
  std::vector<std::string> keys;
  for (const auto& entry : *read->dictionary()) keys.push_back(entry.first);
  EXPECT_EQ(keys, (std::vector<std::string>{"/f", "/manifest.plist"}));
  EXPECT_EQ(read->get("/manifest.plist"), earlier);
}

}  // namespace
}  // namespace vtr
