// Every false answer is explained in the system log: the step, the path and
// the system's error text, at err, while the helper's day file keeps only
// the lines it always had.
#include <sys/stat.h>

#include <functional>
#include <sstream>

#include <gtest/gtest.h>

#include "tests/support/test_support.h"
#include "tests/vitd_helper/helper_sandbox.h"

namespace vtr::testing {
namespace {

std::vector<std::string> Lines(const std::string& text) {
  std::vector<std::string> lines;
  std::stringstream in(text);
  for (std::string line; std::getline(in, line);) lines.push_back(line);
  return lines;
}

bool AnyLineHas(const std::vector<std::string>& lines, const std::string& text) {
  return std::any_of(lines.begin(), lines.end(), [&](const std::string& l) { return l.find(text) != std::string::npos; });
}

TEST(FalseAnswersTest, EachNoIsExplainedInTheSystemLogAndNotInTheDayFile) {
  if (!IsRoot()) GTEST_SKIP() << "the helper chroots into its sandbox root: needs root";
  HelperSandbox sandbox;
  // An immutable file in a tree, and an immutable folder nothing can be made in.
  const std::string work = sandbox.host("/private/var/VTRWorkContainer");
  ASSERT_EQ(::mkdir(work.c_str(), 0755), 0);
  WriteFile(work + "/kept", "x");
  ASSERT_EQ(::mkdir(sandbox.host("/private/var/locked").c_str(), 0755), 0);
  if (!SetImmutable(work + "/kept", true) || !SetImmutable(sandbox.host("/private/var/locked"), true)) {
    GTEST_SKIP() << "the file system has no immutable flag";
  }
  ASSERT_TRUE(sandbox.start()) << sandbox.log();

  const struct {
    const char* key;
    XpcObject parameter;
    const char* reason;  // in the journal's line saying why
  } cases[] = {
      {"removeWorkContainer:", XpcObject::String("/private/var/VTRWorkContainer"),
       "Cannot remove /private/var/VTRWorkContainer: /private/var/VTRWorkContainer/kept: Operation not permitted"},
      {"prepareWorkContainer:", XpcObject::String("/private/var/locked/work"),
       "Cannot create or open the directory /private/var/locked/work: "},
      {"migratePreferencesFile:", XpcObject::Bool(true),
       "/var/root/Library/Preferences/com.orvane.Vitrell.plist: No such file or directory"},
      {"moveStagingToFinal:", XpcObject::String("/private/var/nostaging"),
       "Cannot open the staging directory /private/var/nostaging: /private/var/nostaging: No such file or directory"},
      {"restoreAttributes:", XpcObject::Dictionary({{"StagingRootPath", XpcObject::String("/private/var/VTRWorkContainer")},
                                   {"ManifestPath", XpcObject::String("/private/var/none.plist")}}),
       "Cannot read the signed manifest /private/var/none.plist: /private/var/none.plist: No such file or directory"},
      {"writeNvram:", XpcObject::Dictionary({{"Name", XpcObject::String("x")}, {"Value", XpcObject::String("y")}}),
       "Cannot open the firmware variables /sys/firmware/efi/efivars: "},
      {"deleteNvram:", XpcObject::Int64(3), "Cannot open the firmware variables"},
      {"shrinkDataPartition:", XpcObject::Bool(true), "Cannot open the boot disk /dev/rdisk0s1: No such file or directory"},
      {"prepareLogContainer:", XpcObject::String("/tmp/logs"), "creating logs under /tmp/logs is not allowed."},
  };
  for (const auto& c : cases) {
    const size_t before = Lines(sandbox.log()).size();
    std::vector<XpcObject> replies = sandbox.request(XpcObject::Dictionary({{c.key, c.parameter}}), 1);
    ASSERT_EQ(replies.size(), 1u) << c.key;
    EXPECT_EQ(replies[0].find("Response")->boolValue(), false) << c.key;
    std::vector<std::string> logged = Lines(sandbox.log());
    logged.erase(logged.begin(), logged.begin() + static_cast<long>(before));
    EXPECT_TRUE(AnyLineHas(logged, c.reason)) << c.key << ":\n" << sandbox.log();
    EXPECT_TRUE(AnyLineHas(logged, std::string(c.key) + " answered NO for ")) << c.key;
  }
  // A true answer whose device manifest could not be written says so too.
  ASSERT_TRUE(SetImmutable(work, true));
  std::vector<XpcObject> scanned = sandbox.request(
      XpcObject::Dictionary({{"createDeviceManifest:", XpcObject::Dictionary({{"Path", XpcObject::String("/private/var/locked")}})}}), 1);
  EXPECT_TRUE(SetImmutable(work, false));
  ASSERT_EQ(scanned.size(), 1u);
  EXPECT_EQ(scanned[0].find("Response")->boolValue(), true);
  EXPECT_TRUE(AnyLineHas(Lines(sandbox.log()),
                         "The device manifest was not written: /private/var/VTRWorkContainer/DeviceManifest.plist: "))
      << sandbox.log();

  // The day file has none of the journal's explanations.
  const std::string day = ReadFile(sandbox.dayLogPath());
  EXPECT_NE(day.find("Entering -[VTRHMessageResponder removeWorkContainer:]"), std::string::npos);
  for (const char* journalOnly : {"answered NO", "Cannot remove", "Cannot create or open", "No such file or directory",
                                  "Cannot open the boot disk", "was not written"}) {
    EXPECT_EQ(day.find(journalOnly), std::string::npos) << journalOnly;
  }
  EXPECT_TRUE(SetImmutable(work + "/kept", false));
  EXPECT_TRUE(SetImmutable(sandbox.host("/private/var/locked"), false));
}

}  // namespace
}  // namespace vtr::testing
