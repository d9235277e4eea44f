// The manifest and staging commands, end to end in a sandbox root.
#include <sys/stat.h>
#include <sys/xattr.h>
#include <fcntl.h>
#include <unistd.h>

#include <cstdlib>
#include <fstream>

#include <gtest/gtest.h>
#include <openssl/evp.h>

#include "model/file_metadata.h"
#include "platform/file_manager.h"
#include "platform/format.h"
#include "platform/plist.h"
#include "platform/unique_fd.h"
#include "tests/support/file_inspection.h"
#include "tests/support/test_pki.h"
#include "tests/support/test_support.h"
#include "tests/vitd_helper/helper_sandbox.h"

namespace vtr::testing {
namespace {

using namespace std::chrono_literals;

constexpr char kManifest[] = "/private/var/VTRWorkContainer/DeviceManifest.plist";

void MakeDir(const std::string& path, mode_t mode = 0755) { ASSERT_EQ(::mkdir(path.c_str(), mode), 0) << path; }

class ManifestTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (!IsRoot()) GTEST_SKIP() << "the helper chroots into its sandbox root: needs root";
    MakeDir(sandbox_.host("/private/var/VTRWorkContainer"));
    // A small device: files, a link, a dangling link, extended attributes,
    // owners, a fifo (never opened), hidden entries, the application areas.
    const std::string var = sandbox_.host("/private/var");
    MakeDir(var + "/mobile/Library/Media");
    WriteFile(var + "/mobile/Library/Media/photo.jpg", std::string(300000, 'p'));
    WriteFile(var + "/mobile/Library/empty", "");
    WriteFile(var + "/mobile/.hidden", "h");
    MakeDir(var + "/mobile/.hiddendir");
    WriteFile(var + "/mobile/.hiddendir/deep", "d");
    MakeDir(var + "/mobile/Library/.deephidden");
    ::symlink("Media/photo.jpg", (var + "/mobile/Library/link").c_str());
    ::symlink("/nowhere", (var + "/mobile/Library/dangling").c_str());
    ::symlink("/", (var + "/mobile/Library/rootlink").c_str());
    ::setxattr((var + "/mobile/Library/Media/photo.jpg").c_str(), "user.tag", "\x00\x01zz", 4, 0);
    ::lsetxattr((var + "/mobile/Library/link").c_str(), "trusted.linkattr", "L", 1, 0);
    ::chown((var + "/mobile/Library/empty").c_str(), kMobileUid, kMobileGid);
    ::chmod((var + "/mobile/Library/empty").c_str(), 04751);
    ::mkfifo((var + "/mobile/Library/pipe").c_str(), 0644);
    for (const char* area : {"Containers", "Applications", "BuildraBuiltProducts"}) {
      MakeDir(var + "/mobile/" + area);
      WriteFile(var + "/mobile/" + area + "/skipped", "s");
    }
    WriteFile(var + "/mobile/ContainersX", "kept: only /a/b and below are skipped, not /a/bc");
    ASSERT_TRUE(sandbox_.start()) << sandbox_.log();
  }

  std::vector<XpcObject> createDeviceManifest(const std::string& path, bool inclusive) {
    return sandbox_.request(
        XpcObject::Dictionary({{"createDeviceManifest:", XpcObject::Dictionary({{"Path", XpcObject::String(path)},
                                                                               {"Inclusive", XpcObject::Bool(inclusive)}})}}),
        1, 10000ms);
  }

  // The independent check of the written manifest against the tree.
  std::string check(const std::string& scanRoot, const std::string& relativeTo, std::vector<std::string> options) {
    std::string command = std::string(VTR_SOURCE_DIR) + "/tests/vitd_helper/check_manifest.py " +
                          sandbox_.host(kManifest) + " " + sandbox_.root() + " " + scanRoot + " " + relativeTo;
    for (const std::string& o : options) command += " " + o;
    return sandbox_.run("/bin/sh", {"-c", command + " 2>&1"}).output;
  }

  HelperSandbox sandbox_;
};

TEST_F(ManifestTest, WholeDeviceScanIsRelativeToPrivateSkipsTheApplicationAreasAndReportsProgress) {
  std::vector<XpcObject> messages = createDeviceManifest("/private/var/", false);
  ASSERT_FALSE(messages.empty());
  EXPECT_EQ(messages.back(), XpcObject::Dictionary({{"Response", XpcObject::Bool(true)}}));
  int64_t last = 0;
  for (size_t i = 0; i + 1 < messages.size(); ++i) {
    const XpcObject* progress = messages[i].find("Progress");
    ASSERT_NE(progress, nullptr);
    EXPECT_GT(*progress->int64Value(), last);  // rises only, never 0
    last = *progress->int64Value();
  }
  EXPECT_GE(last, 100);
  EXPECT_TRUE(sandbox_.logged("Device manifest created (for /private/var/)"));
  EXPECT_TRUE(sandbox_.logged("/private/var/mobile/Library/pipe is special file. Leave it along"));

  // The helper's own log changes while it scans, and the manifest did not
  // exist yet: neither is compared. Root's home is closed to clients: never
  // recorded.
  const std::string report = check("/private/var", "/private",
                                   {"--skip /private/var/mobile/Containers", "--skip /private/var/mobile/Applications",
                                    "--skip /private/var/mobile/BuildraBuiltProducts", "--skip " + std::string(kManifest),
                                    "--skip /private/var/root", "--ignore /private/var/logs"});
  EXPECT_NE(report.find(" 0 differences"), std::string::npos) << report;

  Result<Value> manifest = ReadPropertyListFile(sandbox_.host(kManifest));
  ASSERT_TRUE(manifest.ok());
  EXPECT_TRUE(manifest->get("/var/mobile/Library/Media/photo.jpg").dictionary());
  EXPECT_TRUE(manifest->get("/var/mobile/ContainersX").dictionary());
  EXPECT_TRUE(manifest->get("/var/mobile/.hidden").dictionary());  // hidden entries count on a whole device
  EXPECT_TRUE(manifest->get("/var/mobile/Containers").isNil());
  EXPECT_TRUE(manifest->get("/var/mobile/Library/pipe").isNil());
  EXPECT_TRUE(manifest->get("/var").isNil());  // not inclusive
  EXPECT_TRUE(manifest->get("/var/root").isNil());
}

TEST_F(ManifestTest, SubtreeIsRelativeToItselfAndSkipsOnlyItsImmediateHiddenEntries) {
  std::vector<XpcObject> messages = createDeviceManifest("/private/var/mobile", true);
  // No progress for anything but the whole device.
  EXPECT_EQ(messages, std::vector<XpcObject>{XpcObject::Dictionary({{"Response", XpcObject::Bool(true)}})});
  Result<Value> manifest = ReadPropertyListFile(sandbox_.host(kManifest));
  ASSERT_TRUE(manifest.ok());
  EXPECT_TRUE(manifest->get("/").dictionary());  // inclusive: the tree itself
  EXPECT_TRUE(manifest->get("/Library/.deephidden").dictionary());
  EXPECT_TRUE(manifest->get("/.hidden").isNil());
  EXPECT_TRUE(manifest->get("/.hiddendir/deep").isNil());
  EXPECT_TRUE(manifest->get("/Containers/skipped").dictionary());
  EXPECT_EQ(*manifest->get("/Library/link").get("VTRManifestSymbolicLinkTargetFile").string(), "Media/photo.jpg");
  EXPECT_EQ(*manifest->get("/Library/rootlink").get("VTRManifestSymbolicLinkTargetFile").string(), "/");
  EXPECT_EQ(manifest->get("/Library/rootlink/private").type(), Value::Type::kNil);  // never followed

  // A path that is not one of the four whole-device spellings is a subtree.
  messages = createDeviceManifest("/private//var", false);
  EXPECT_EQ(messages.size(), 1u);
}

TEST_F(ManifestTest, MissingWorkContainerStillAnswersTrueButWritesNothing) {
  ASSERT_EQ(::rmdir(sandbox_.host("/private/var/VTRWorkContainer").c_str()), 0);
  std::vector<XpcObject> messages = createDeviceManifest("/private/var/mobile/Library", false);
  EXPECT_EQ(messages, std::vector<XpcObject>{XpcObject::Dictionary({{"Response", XpcObject::Bool(true)}})});
  EXPECT_FALSE(Exists(sandbox_.host("/private/var/VTRWorkContainer")));
  EXPECT_TRUE(sandbox_.logged("Device manifest created (for /private/var/mobile/Library)"));
}

TEST_F(ManifestTest, HardLinksAndMoveToFinal) {
  auto request = [&](const std::string& key, XpcObject value) {
    return sandbox_.request(XpcObject::Dictionary({{key, std::move(value)}}), 1);
  };
  const XpcObject yes = XpcObject::Dictionary({{"Response", XpcObject::Bool(true)}});
  const XpcObject no = XpcObject::Dictionary({{"Response", XpcObject::Bool(false)}});
  MakeDir(sandbox_.host("/private/var/staging"));
  auto link = [](const std::string& from, const std::string& to) {
    return XpcObject::Dictionary({{"FilePath", XpcObject::String(from)}, {"StagingPath", XpcObject::String(to)}});
  };

  // A file: same inode. A directory: its tree, files linked, links recreated.
  EXPECT_EQ(request("createHardLink:", link("/private/var/mobile/Library/Media/photo.jpg", "/private/var/staging/p")),
            std::vector<XpcObject>{yes});
  EXPECT_EQ(Lstat(sandbox_.host("/private/var/staging/p")).st_ino,
            Lstat(sandbox_.host("/private/var/mobile/Library/Media/photo.jpg")).st_ino);
  EXPECT_EQ(request("createHardLink:", link("/private/var/mobile/Library/Media", "/private/var/staging/Media")),
            std::vector<XpcObject>{yes});
  EXPECT_EQ(Lstat(sandbox_.host("/private/var/staging/Media/photo.jpg")).st_ino,
            Lstat(sandbox_.host("/private/var/mobile/Library/Media/photo.jpg")).st_ino);
  // Onto an existing destination: refused with the link message.
  EXPECT_EQ(request("createHardLink:", link("/private/var/mobile/.hidden", "/private/var/staging/p")),
            std::vector<XpcObject>{no});
  EXPECT_NE(sandbox_.log().find("Could not link /private/var/mobile/.hidden to /private/var/staging/p with error -"),
            std::string::npos);

  // Move to final: an old /var/backup is replaced; a file is no staging path.
  MakeDir(sandbox_.host("/private/var/backup"));
  WriteFile(sandbox_.host("/private/var/backup/old"), "old");
  EXPECT_EQ(request("moveStagingToFinal:", XpcObject::String("/private/var/mobile/.hidden")),
            std::vector<XpcObject>{no});
  EXPECT_TRUE(sandbox_.logged("Staging path /private/var/mobile/.hidden looks wrong."));
  EXPECT_TRUE(Exists(sandbox_.host("/private/var/backup/old")));
  EXPECT_EQ(request("moveStagingToFinal:", XpcObject::String("/private/var/staging")), std::vector<XpcObject>{yes});
  EXPECT_FALSE(Exists(sandbox_.host("/private/var/backup/old")));
  EXPECT_TRUE(Exists(sandbox_.host("/private/var/backup/Media/photo.jpg")));
  EXPECT_FALSE(Exists(sandbox_.host("/private/var/staging")));
  EXPECT_TRUE(sandbox_.logged("Move the whole thing together."));
}

TEST_F(ManifestTest, RestoreAttributesFromASignedManifestOfTheHelpersOwnRecords) {
  // The vendor's record of mobile's Library, signed; the anchors in the root.
  ASSERT_EQ(createDeviceManifest("/private/var/mobile/Library", true).back(),
            XpcObject::Dictionary({{"Response", XpcObject::Bool(true)}}));
  Result<Value> records = ReadPropertyListFile(sandbox_.host(kManifest));
  ASSERT_TRUE(records.ok());
  const TestPki& pki = TestPki::Get();
  const std::string anchors = sandbox_.host("/usr/share/vitd/anchors/production");
  ASSERT_EQ(std::system(("mkdir -p '" + anchors + "' && cp '" + pki.file("production") + "'/*.pem '" + anchors + "'").c_str()), 0);
  const Bytes signedManifest = pki.productionSigned(Value::DictionaryOf(
      {{"Version", Value::Integer(4)}, {"Info", Value::String("demo")}, {"Backup", *records},
       {"App", Value::ArrayOf({})}, {"AppData", Value::DictionaryOf({})}}));
  WriteFile(sandbox_.host("/private/var/mobile/demo.plist"), std::string(signedManifest.begin(), signedManifest.end()));

  // The same content laid down again by the daemon: mobile's, plain modes.
  const std::string staging = sandbox_.host("/private/var/staging");
  ASSERT_EQ(std::system(("cp -a '" + sandbox_.host("/private/var/mobile/Library") + "' '" + staging + "' && chown -hR 501:501 '" +
                         staging + "' && chmod 0644 '" + staging + "/empty' && setfattr -x user.tag '" + staging +
                         "/Media/photo.jpg'").c_str()),
            0);
  HelperSandbox::RunResult restored = sandbox_.run(
      VitdctlExecutable(), {"--root", sandbox_.root(), "--timeout", "10", "restoreAttributes", "/private/var/staging",
                            "/private/var/mobile/demo.plist"});
  EXPECT_EQ(restored.output, "{\"Response\":true}\n");
  EXPECT_EQ(restored.status, 0);
  EXPECT_TRUE(sandbox_.logged("Loading signed manifest."));
  EXPECT_TRUE(sandbox_.logged("Manifest passed signature check."));
  EXPECT_EQ(Lstat(staging + "/empty").st_mode & 07777, 04751u);
  EXPECT_EQ(Lstat(staging + "/empty").st_uid, kMobileUid);
  EXPECT_EQ(Lstat(staging + "/Media/photo.jpg").st_uid, 0u);
  EXPECT_EQ(Xattr(staging + "/Media/photo.jpg", "user.tag"), std::string("\x00\x01zz", 4));
  EXPECT_EQ(Lstat(staging + "/link").st_uid, 0u);

  // A container that is not there.
  restored = sandbox_.run(VitdctlExecutable(), {"--root", sandbox_.root(), "--timeout", "10", "restoreAttributes",
                                                "/private/var/staging", "/private/var/mobile/demo.plist", "--type",
                                                "AppData", "--identifier", "com.none"});
  EXPECT_EQ(restored.output, "{\"Response\":false}\n");
  EXPECT_TRUE(sandbox_.logged("Couldn't load container data for AppData/com.none"));
}

// The peak resident memory of process pid so far, in bytes.
uint64_t PeakMemory(pid_t pid) {
  std::ifstream status("/proc/" + std::to_string(pid) + "/status");
  for (std::string line; std::getline(status, line);) {
    if (line.rfind("VmHWM:", 0) == 0) return std::stoull(line.substr(6)) * 1024;
  }
  return 0;
}

// A whole device's worth of records is read in place from the signed
// manifest and built one at a time: the helper stays under 64 MiB plus 500
// bytes a record (building them all would take several times that).
TEST(RestoreMemoryTest, ManyRecordsAreRestoredWithinTheMemoryBound) {
  if (!IsRoot()) GTEST_SKIP() << "the helper chroots into its sandbox root: needs root";
  if (kUnderAddressSanitizer) GTEST_SKIP() << "the address sanitizer changes what memory a process takes";
  constexpr int kDirectories = 100;
  constexpr int kFilesEach = 1000;
  HelperSandbox sandbox;
  const std::string staging = sandbox.host("/private/var/staging");
  MakeDir(staging);
  WriteFile(staging + "/template", "");
  const Value model = VTRFileMetadata::initWithPath(staging + "/template")->dict();

  // The content as the daemon laid it (mobile's), each file its own key;
  // the records say root's, so each file is copied and hashed.
  DictionaryBuilder records;
  for (int d = 0; d < kDirectories; ++d) {
    const std::string directory = Format("/d%03d", d);
    MakeDir(staging + directory);
    for (int f = 0; f < kFilesEach; ++f) {
      const std::string key = Format("%s/f%04d", directory, f);
      UniqueFd file(::open((staging + key).c_str(), O_CREAT | O_WRONLY | O_CLOEXEC, 0600));
      ASSERT_TRUE(file && ::write(file.get(), key.data(), key.size()) == static_cast<ssize_t>(key.size()) &&
                  ::fchown(file.get(), kMobileUid, kMobileGid) == 0)
          << key;
      DictionaryBuilder record;
      for (const auto& [name, value] : *model.dictionary()) {
        if (name == kVTRManifestFileHash) {
          Bytes sha1(20);
          ASSERT_EQ(EVP_Digest(key.data(), key.size(), sha1.data(), nullptr, EVP_sha1(), nullptr), 1);
          record.add(name, Value::Data(std::move(sha1)));
        } else if (name == kVTRManifestFileAttributes) {
          DictionaryBuilder attributes;
          for (const auto& [attribute, setting] : *value.dictionary()) {
            attributes.add(attribute, attribute == kNSFileSize ? Value::Unsigned(key.size()) : setting);
          }
          record.add(name, attributes.build());
        } else {
          record.add(name, value);
        }
      }
      records.add(key, record.build());
    }
  }
  const TestPki& pki = TestPki::Get();
  const std::string anchors = sandbox.host("/usr/share/vitd/anchors/production");
  ASSERT_EQ(std::system(("mkdir -p '" + anchors + "' && cp '" + pki.file("production") + "'/*.pem '" + anchors + "'").c_str()), 0);
  const Bytes signedManifest = pki.productionSigned(Value::DictionaryOf(
      {{"Version", Value::Integer(3)}, {"Info", Value::String("many")}, {"Backup", records.build()},
       {"App", Value::ArrayOf({})}, {"AppData", Value::DictionaryOf({})}}));
  WriteFile(sandbox.host("/private/var/many.plist"), std::string(signedManifest.begin(), signedManifest.end()));

  ASSERT_TRUE(sandbox.start()) << sandbox.log();
  const HelperSandbox::RunResult restored =
      sandbox.run(VitdctlExecutable(), {"--root", sandbox.root(), "--timeout", "120", "restoreAttributes",
                                        "/private/var/staging", "/private/var/many.plist"});
  EXPECT_EQ(restored.output, "{\"Response\":true}\n") << sandbox.log();
  const uint64_t peak = PeakMemory(sandbox.pid());
  ASSERT_GT(peak, 0u) << "the helper's peak memory could not be read";
  const uint64_t bound = (uint64_t{64} << 20) + uint64_t{500} * kDirectories * kFilesEach;
  EXPECT_LT(peak, bound) << "peak " << peak / 1024 << " KiB";
  EXPECT_EQ(Lstat(staging + Format("/d%03d/f%04d", kDirectories - 1, kFilesEach - 1)).st_uid, 0u);
}

}  // namespace
}  // namespace vtr::testing
