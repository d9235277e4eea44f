// The manifest builder: the skip and key rules, what a fill records and in
// which order, how it ends, and the progress it reports. Fills run both with
// worker threads and one item at a time; both must behave the same.
#include "model/manifest.h"

#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "platform/file_manager.h"
#include "tests/model/manifest_test_support.h"
#include "tests/support/test_support.h"

namespace vtr {
namespace {

using testing::LogCapture;
using testing::TempDir;
using testing::WriteFile;

constexpr char kFillRoutine[] =
    "__77-[VTRManifest enumerateAndCollectMetaData:relativeTo:skip:inclusive:handler:]_block_invoke";

TEST(ManifestRulesTest, FolderContains) {
  const struct {
    std::vector<std::string> skip;
    std::string path;
    bool contained;
  } cases[] = {
      {{"/a/b"}, "/a/b", true},
      {{"/a/b"}, "/a/b/c", true},
      {{"/a/b"}, "/a/b/c/d", true},
      {{"/a/b"}, "/a/bc", false},
      {{"/a/b"}, "/a", false},
      {{"/a/b"}, "/x/a/b", false},
      {{"/a/b/"}, "/a/b/c", true},
      {{"/a/b/"}, "/a/b", false},
      {{""}, "/a", false},
      {{}, "/a", false},
      {{"/x", "/a/bc"}, "/a/bc/d", true},
      {{"/a/b"}, "/a/b//c", false},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.path);
    EXPECT_EQ(VTRManifest::folder(c.skip, c.path), c.contained);
  }
}

// The helper's rule for the paths clients send, and the exact prefix the
// tools use, over the same paths.
TEST(ManifestRulesTest, RelativeAndPrefixKeys) {
  const std::optional<std::string> none;
  const struct {
    std::string item;
    std::string root;
    std::optional<std::string> key;
    std::optional<std::string> prefixKey;
  } cases[] = {
      {"/private/var/mobile/Library/x", "/private/var/mobile", "/Library/x", "/Library/x"},
      {"/private/var/mobile", "/private/var/mobile", "/", "/"},
      {"/private/var/db", "/private", "/var/db", "/var/db"},
      {"/r/a/r/b", "/r", "/a/b", "/a/r/b"},  // every occurrence goes
      {"/x/r/a", "/r", "/a", none},          // found later: the rest after it
      {"/x/r/a/r/b", "/r", "/a/b", none},
      {"/q/a", "/r", none, none},            // not found: the fill reuses the previous key
      {"/a", "", none, "/a"},
      {"/private/var/mobile/x", "/private/var/mobile/", "x", "/x"},
      {"/t/xz-utils/tt", "/t", "/xz-utilst", "/xz-utils/tt"},
      {"/tt", "/t", "t", none},
      {"/etc", "/", "etc", "/etc"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.item + " relative to " + c.root);
    EXPECT_EQ(VTRManifest::RelativeKey(c.item, c.root), c.key);
    EXPECT_EQ(VTRManifest::PrefixKey(c.item, c.root), c.prefixKey);
  }
}

Value RecordOf(const std::string& path) {
  std::optional<VTRFileMetadata> record = VTRFileMetadata::fileMetadatatWithPath(path);
  return record ? record->dict() : Value();
}

std::vector<std::string> Keys(const VTRManifest& manifest) {
  const std::set<std::string> paths = manifest.pathSet();
  return {paths.begin(), paths.end()};
}

class ManifestFillTest : public ::testing::TestWithParam<unsigned> {
 protected:
  VTRManifest NewManifest() {
    VTRManifest manifest;
    manifest.setRecordThreads(GetParam());
    return manifest;
  }
};

INSTANTIATE_TEST_SUITE_P(Threads, ManifestFillTest, ::testing::Values(0u, 3u),
                         [](const ::testing::TestParamInfo<unsigned>& info) {
                           return info.param == 0 ? std::string("OneAtATime") : "Workers" + std::to_string(info.param);
                         });

TEST_P(ManifestFillTest, RecordsEveryItemButSkippedAndSpecialOnes) {
  TempDir dir;
  for (const char* d : {"a", "a/b", "a/b/c", "a/bc", ".hidden"}) ASSERT_EQ(::mkdir((dir / d).c_str(), 0755), 0);
  WriteFile(dir / "a/b/c/f", "skipped");
  WriteFile(dir / "a/bc/f", "kept");
  WriteFile(dir / ".hidden/f", "");
  ASSERT_EQ(::symlink("a/bc/f", (dir / "link").c_str()), 0);
  ASSERT_EQ(::mkfifo((dir / "fifo").c_str(), 0600), 0);

  LogCapture log;
  VTRManifest manifest = NewManifest();
  ASSERT_TRUE(manifest.addFilesFromPath(dir.path(), dir.path(), {dir / "a/b"}, false));
  EXPECT_EQ(Keys(manifest), (std::vector<std::string>{"/.hidden", "/.hidden/f", "/a", "/a/bc", "/a/bc/f", "/link"}));
  for (const std::string& key : manifest.pathSet()) {
    SCOPED_TRACE(key);
    EXPECT_EQ(manifest.metadataForFile(key)->dict(), RecordOf(dir.path() + key));
  }
  EXPECT_TRUE(log.contains(dir / "fifo" + " is special file. Leave it along"));
  EXPECT_EQ(manifest.rootPath(), dir.path());
}

TEST_P(ManifestFillTest, InclusiveAddsTheTreeItselfLast) {
  TempDir dir;
  WriteFile(dir / "f", "x");
  std::vector<std::string> order;
  VTRManifest manifest = NewManifest();
  ASSERT_TRUE(manifest.enumerateAndCollectMetaData(dir.path() + "/", dir.path(), {}, true,
                                                   [&](const VTRFileMetadata& record, const std::string& key) {
                                                     order.push_back(key);
                                                     if (key == "/") {
                                                       EXPECT_EQ(record.dict(), RecordOf(dir.path()));
                                                     }
                                                     return true;
                                                   }));
  EXPECT_EQ(order, (std::vector<std::string>{"/f", "/"}));

  // An empty tree without inclusive records nothing and succeeds.
  TempDir empty;
  VTRManifest none = NewManifest();
  EXPECT_TRUE(none.addFilesFromPath(empty.path(), empty.path(), {}, false));
  EXPECT_EQ(none.count(), 0u);
}

TEST_P(ManifestFillTest, AnItemOutsideTheRootTakesThePreviousKey) {
  TempDir dir;
  ASSERT_EQ(::mkdir((dir / "b").c_str(), 0755), 0);
  WriteFile(dir / "a", "first");
  WriteFile(dir / "b/f", "inside");
  WriteFile(dir / "c", "last");
  // Keys relative to dir/b: "a" has none yet (so "/"), "b" is "/", "b/f" is
  // "/f", and "c" takes "/f" again, replacing b/f's record.
  std::vector<std::string> keys;
  VTRManifest manifest = NewManifest();
  ASSERT_TRUE(manifest.enumerateAndCollectMetaData(dir.path(), dir / "b", {}, false,
                                                   [&](const VTRFileMetadata& record, const std::string& key) {
                                                     keys.push_back(key);
                                                     manifest.setMetadata(record, key);
                                                     return true;
                                                   }));
  EXPECT_EQ(keys, (std::vector<std::string>{"/", "/", "/f", "/f"}));
  EXPECT_EQ(manifest.metadataForFile("/")->dict(), RecordOf(dir / "b"));
  EXPECT_EQ(manifest.metadataForFile("/f")->dict(), RecordOf(dir / "c"));
}

TEST_P(ManifestFillTest, ASecondFillIsRefusedAndChangesNothing) {
  TempDir dir;
  WriteFile(dir / "f", "");
  VTRManifest manifest = NewManifest();
  ASSERT_TRUE(manifest.addFilesFromPath(dir.path(), dir.path(), {}, false));
  const Value before = manifest.dict();
  WriteFile(dir / "g", "");
  EXPECT_FALSE(manifest.addFilesFromPath(dir.path(), dir.path(), {}, true));
  EXPECT_EQ(manifest.dict(), before);

  // A loaded manifest may be filled once.
  VTRManifest loaded = VTRManifest::initWithDictionary(*before.dictionary());
  EXPECT_FALSE(loaded.rootPath().has_value());
  EXPECT_TRUE(loaded.addFilesFromPath(dir.path(), dir.path(), {}, false));
  EXPECT_EQ(Keys(loaded), (std::vector<std::string>{"/f", "/g"}));
}

TEST_P(ManifestFillTest, AHandlerRefusalEndsTheFillWithNoAndNothingAfterIsLogged) {
  TempDir dir;
  for (const char* name : {"a", "b", "c"}) WriteFile(dir / name, name);
  ASSERT_EQ(::mkfifo((dir / "d").c_str(), 0600), 0);
  LogCapture log;
  std::vector<std::string> keys;
  VTRManifest manifest = NewManifest();
  EXPECT_FALSE(manifest.enumerateAndCollectMetaData(dir.path(), dir.path(), {}, true,
                                                    [&](const VTRFileMetadata&, const std::string& key) {
                                                      keys.push_back(key);
                                                      return key != "/b";
                                                    }));
  EXPECT_EQ(keys, (std::vector<std::string>{"/a", "/b"}));
  EXPECT_EQ(log.messages(), std::vector<std::string>{"Couldn't run handler against " + dir / "b"});
}

TEST(ManifestFillEndTest, AnItemThatVanishesEndsTheFillWithYes) {
  TempDir dir;
  for (const char* name : {"a", "b", "c"}) WriteFile(dir / name, name);
  LogCapture log;
  VTRManifest manifest;
  manifest.setRecordThreads(0);  // so that b is read after a's handler ran
  EXPECT_TRUE(manifest.enumerateAndCollectMetaData(dir.path(), dir.path(), {}, false,
                                                   [&](const VTRFileMetadata& record, const std::string& key) {
                                                     if (key == "/a") ::unlink((dir / "b").c_str());
                                                     manifest.setMetadata(record, key);
                                                     return true;
                                                   }));
  EXPECT_EQ(Keys(manifest), std::vector<std::string>{"/a"});
  EXPECT_TRUE(log.contains("Couldn't get meta data for " + dir / "b"));
}

TEST_P(ManifestFillTest, ProgressCountsRegularFilesAgainstEveryItemsSize) {
  TempDir dir;
  ASSERT_EQ(::mkdir((dir / "sub").c_str(), 0755), 0);
  ASSERT_EQ(::mkdir((dir / "skipped").c_str(), 0755), 0);
  WriteFile(dir / "sub/one", std::string(3000, 'x'));
  WriteFile(dir / "two", std::string(1000, 'y'));
  WriteFile(dir / "skipped/big", std::string(50000, 'z'));
  ASSERT_EQ(::symlink("two", (dir / "link").c_str()), 0);

  LogCapture log;
  VTRProgressUpdater updater;
  std::vector<int64_t> sent;
  updater.setSender([&](int64_t percent) { sent.push_back(percent); });
  VTRManifest manifest = NewManifest();
  manifest.setProgressUpdater(&updater);
  ASSERT_TRUE(manifest.addFilesFromPath(dir.path(), dir.path(), {dir / "skipped"}, false));

  EXPECT_EQ(updater.total(), 4000);
  EXPECT_TRUE(log.contains("Initializing percent with total 4000"));
  int64_t recorded = 0;
  for (const std::string& key : manifest.pathSet()) {
    recorded += static_cast<int64_t>(VTRManifest::fileSizeToAdjustPercentage(dir.path() + key));
  }
  EXPECT_EQ(updater.finished(), recorded);  // directories and links count too
  ASSERT_FALSE(sent.empty());
  EXPECT_TRUE(std::is_sorted(sent.begin(), sent.end()));
  EXPECT_EQ(sent.back(), recorded * 100 / 4000);

  // Without an updater no total is made.
  LogCapture quiet;
  VTRManifest plain = NewManifest();
  ASSERT_TRUE(plain.addFilesFromPath(dir.path(), dir.path(), {}, false));
  EXPECT_TRUE(quiet.messages().empty());
}

TEST_P(ManifestFillTest, UnreadableDirectoryIsLoggedAndTheFillGoesOn) {
  TempDir dir;
  ASSERT_EQ(::chmod(dir.path().c_str(), 0755), 0);
  for (const char* d : {"locked", "open"}) ASSERT_EQ(::mkdir((dir / d).c_str(), 0755), 0);
  WriteFile(dir / "locked/inside", "");
  WriteFile(dir / "open/after", "");
  ASSERT_EQ(::chmod((dir / "locked").c_str(), 0), 0);
  const unsigned threads = GetParam();

  const std::string failure = testing::RunUnprivileged([&]() -> std::string {
    LogCapture log;
    VTRManifest manifest;
    manifest.setRecordThreads(threads);
    if (!manifest.addFilesFromPath(dir.path(), dir.path(), {}, false)) return "the fill failed";
    if (Keys(manifest) != std::vector<std::string>{"/locked", "/open", "/open/after"}) return "wrong keys";
    const std::string locked = dir / "locked";
    const std::string expected = std::string(kFillRoutine) + ": Could not enumerate " + locked + ", url=file://" +
                                 locked + ", error=" + locked + ": Permission denied";
    if (log.messages() != std::vector<std::string>{expected}) {
      std::string got;
      for (const std::string& m : log.messages()) got += m + "\n";
      return "logged:\n" + got;
    }
    return "";
  });
  EXPECT_EQ(failure, "");
}

TEST(ManifestQueriesTest, LoadedEntriesAndHiddenFiles) {
  const Value record = Value::DictionaryOf({{kVTRManifestFileHash, Value::Data(Bytes{1, 2})}});
  const VTRManifest manifest = VTRManifest::initWithDictionary(
      *Value::DictionaryOf({{"/record", record}, {"/not-a-record", Value::String("x")}}).dictionary());
  EXPECT_EQ(manifest.pathSet(), (std::set<std::string>{"/not-a-record", "/record"}));
  EXPECT_EQ(manifest.metadataForFile("/record")->dict(), record);
  EXPECT_FALSE(manifest.metadataForFile("/not-a-record").has_value());
  EXPECT_FALSE(manifest.metadataForFile("/unknown").has_value());

  TempDir dir;
  for (const char* name : {".a", "b", "..c"}) WriteFile(dir / name, "");
  EXPECT_EQ(VTRManifest::immediateHiddenFilesUnderPath(dir.path() + "/"),
            (std::vector<std::string>{dir / "..c", dir / ".a"}));
  EXPECT_TRUE(VTRManifest::immediateHiddenFilesUnderPath(dir / "absent").empty());
}

TEST(ManifestQueriesTest, TotalSizeCountsRegularFilesOutsideTheSkipList) {
  TempDir dir;
  WriteFile(dir / "a", "12345");
  ASSERT_EQ(::mkdir((dir / "d").c_str(), 0755), 0);
  WriteFile(dir / "d/b", "123");
  ASSERT_EQ(::symlink("a", (dir / "link").c_str()), 0);
  EXPECT_EQ(VTRManifest::calculateTotalFileSize(dir.path(), {}), 8u);
  EXPECT_EQ(VTRManifest::calculateTotalFileSize(dir.path(), {dir / "d"}), 5u);
  EXPECT_EQ(VTRManifest::fileSizeToAdjustPercentage(dir / "a"), 5u);
  EXPECT_EQ(VTRManifest::fileSizeToAdjustPercentage(dir / "absent"), 0u);
}

}  // namespace
}  // namespace vtr
