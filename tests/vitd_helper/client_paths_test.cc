// The client areas and the resolver's text rules, without root or a socket.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "platform/open_beneath.h"
#include "tests/support/test_support.h"
#include "vitd_helper/client_path_resolver.h"

namespace vtr::testing {
namespace {

TEST(ClientAreasTest, ParseReadsDirectivesAndRefusesWhatItCannotUse) {
  Result<ClientAreas> areas = ClientAreas::Parse(
      "# where clients may work\n"
      "area /private/var/mobile\n"
      "  area\t/var/demo   # the alias\n"
      "closed /private/var/mobile/secret\n");
  ASSERT_TRUE(areas.ok()) << areas.error().description();
  EXPECT_EQ(areas->areas, (std::vector<std::string>{"/private/var/mobile", "/private/var/demo"}));
  // The helper's own log folder is closed whatever the file says, where an
  // area holds it.
  EXPECT_EQ(areas->closed, (std::vector<std::string>{"/private/var/mobile/secret"}));
  EXPECT_EQ(ClientAreas::Parse("area /private/var\n")->closed, (std::vector<std::string>{kHelperLogFolder}));

  const struct {
    const char* text;
    const char* why;
  } refused[] = {
      {"", "names no area"},
      {"closed /private/var/x\n", "names no area"},
      {"area\n", "line 1"},
      {"area /a /b\n", "line 1"},
      {"\narea relative/path\n", "line 2: not an absolute path"},
      {"area /private/var/../etc\n", "line 1: a \"..\" component"},
      {"allow /private/var\n", "line 1"},
      {"area /private/var/a\nclosed /private/var/b\n", "closed tree /private/var/b lies in no area"},
  };
  for (const auto& c : refused) {
    Result<ClientAreas> result = ClientAreas::Parse(c.text);
    ASSERT_FALSE(result.ok()) << c.text;
    EXPECT_NE(result.error().message().find(c.why), std::string::npos) << c.text << ": " << result.error().message();
  }
}

TEST(ClientAreasTest, LoadTakesTheDefaultsOnlyWithoutAFileAndRefusesOneOthersCouldWrite) {
  TempDir root;
  UniqueFd rootFd(::open(root.path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  Result<ClientAreas> absent = ClientAreas::Load(rootFd.get());
  ASSERT_TRUE(absent.ok());
  EXPECT_EQ(absent->areas, ClientAreas::Defaults().areas);

  ASSERT_EQ(::mkdir((root / "etc").c_str(), 0755), 0);
  ASSERT_EQ(::mkdir((root / "etc/vitd").c_str(), 0755), 0);
  WriteFile(root / "etc/vitd/helper.conf", "area /private/var/mobile\n");
  if (!IsRoot()) GTEST_SKIP() << "the file must be root's: needs root";
  ASSERT_EQ(::chmod((root / "etc/vitd/helper.conf").c_str(), 0644), 0);
  Result<ClientAreas> loaded = ClientAreas::Load(rootFd.get());
  ASSERT_TRUE(loaded.ok()) << loaded.error().description();
  EXPECT_EQ(loaded->areas, (std::vector<std::string>{"/private/var/mobile"}));

  const auto refusedWith = [&rootFd](const std::string& why) {
    Result<ClientAreas> result = ClientAreas::Load(rootFd.get());
    return !result.ok() && result.error().message().find(why) != std::string::npos;
  };
  ASSERT_EQ(::chmod((root / "etc/vitd/helper.conf").c_str(), 0664), 0);
  EXPECT_TRUE(refusedWith("writable by group or others"));
  ASSERT_EQ(::chmod((root / "etc/vitd/helper.conf").c_str(), 0644), 0);
  ASSERT_EQ(::chown((root / "etc/vitd/helper.conf").c_str(), 501, 0), 0);
  EXPECT_TRUE(refusedWith("owned by uid 501"));
  ASSERT_EQ(::chown((root / "etc/vitd/helper.conf").c_str(), 0, 0), 0);
  ASSERT_EQ(::chmod((root / "etc/vitd").c_str(), 0777), 0);
  EXPECT_TRUE(refusedWith("/etc/vitd is writable"));
  ASSERT_EQ(::chmod((root / "etc/vitd").c_str(), 0755), 0);
  // A link in place of the file is not followed, whatever it points at.
  ASSERT_EQ(::rename((root / "etc/vitd/helper.conf").c_str(), (root / "etc/vitd/real.conf").c_str()), 0);
  ASSERT_EQ(::symlink("real.conf", (root / "etc/vitd/helper.conf").c_str()), 0);
  EXPECT_TRUE(refusedWith("a symbolic link stands at /etc/vitd/helper.conf"));
}

TEST(ClientPathResolverTest, TextRulesAreasAndClosedTrees) {
  TempDir root;
  ClientPathResolver resolver(ClientAreas::Defaults(),
                              std::make_shared<const UniqueFd>(::open(root.path().c_str(), O_RDONLY | O_DIRECTORY)));
  const struct {
    const char* path;
    bool scan;    // allowed for a read-only walk
    bool change;  // allowed for a change
    const char* normalised;
  } cases[] = {
      {"/private/var/mobile/x", true, true, "/private/var/mobile/x"},
      {"/var/mobile//x/./", true, true, "/private/var/mobile/x"},
      {"/private/var", true, false, "/private/var"},
      {"/var/", true, false, "/private/var"},
      {"/private/var/logs", true, false, "/private/var/logs"},
      {"/private/var/logs/vitd", false, false, nullptr},
      {"/private/var/logs/vitd/x.log", false, false, nullptr},
      {"/var/root/Library", false, false, nullptr},
      {"/private/var/rootkit", true, true, "/private/var/rootkit"},
      {"/private/varx", false, false, nullptr},
      {"/etc/passwd", false, false, nullptr},
      {"/private/var/logs/../../../etc", false, false, nullptr},
      {"private/var/x", false, false, nullptr},
      {"", false, false, nullptr},
      {"/", false, false, nullptr},
  };
  for (const auto& c : cases) {
    Result<CheckedPath> scan = resolver.check(c.path, ClientUse::kScan);
    Result<CheckedPath> change = resolver.check(c.path, ClientUse::kChange);
    EXPECT_EQ(scan.ok(), c.scan) << c.path;
    EXPECT_EQ(change.ok(), c.change) << c.path;
    if (scan.ok()) {
      EXPECT_EQ(scan->path, c.normalised) << c.path;
    }
  }
  EXPECT_FALSE(resolver.check(std::string("/private/var/a\0b", 16), ClientUse::kScan).ok());
  EXPECT_EQ(resolver.closedTreesWithin(*resolver.check("/var/", ClientUse::kScan), "/var/"),
            (std::vector<std::string>{"/var/root", "/var/logs/vitd"}));
}

TEST(ClientPathResolverTest, NoLinkIsFollowedAtAnyPosition) {
  TempDir root;
  ASSERT_EQ(::mkdir((root / "real").c_str(), 0755), 0);
  ASSERT_EQ(::mkdir((root / "real/d").c_str(), 0755), 0);
  ASSERT_EQ(::symlink("real", (root / "link").c_str()), 0);
  ASSERT_EQ(::symlink("d", (root / "real/dlink").c_str()), 0);
  WriteFile(root / "real/file", "x");
  UniqueFd rootFd(::open(root.path().c_str(), O_RDONLY | O_DIRECTORY));
  const struct {
    const char* path;
    int error;  // 0: opens
  } cases[] = {
      {"/real/d", 0},        {"/real/d/", 0},          {"/link/d", ELOOP}, {"/link", ELOOP},
      {"/link/", ELOOP},     {"/real/dlink", ELOOP},   {"/real/dlink/", ELOOP},
      {"/real/file", ENOTDIR}, {"/real/file/", ENOTDIR}, {"/real/missing", ENOENT},
  };
  // A chain keeping its directories open answers each path the same, in
  // any order, after failures too, and reaches the same directories.
  OpenDirectoryChain chain(rootFd.get());
  for (int round = 0; round < 2; ++round) {
    for (const auto& c : cases) {
      Result<std::vector<std::string>> components = SplitPathComponents(c.path);
      ASSERT_TRUE(components.ok());
      Result<UniqueFd> opened = OpenDirectoryBeneath(rootFd.get(), *components, components->size());
      EXPECT_EQ(opened.ok() ? 0 : opened.error().code(), c.error) << c.path;
      Result<int> chained = chain.open(*components, components->size());
      EXPECT_EQ(chained.ok() ? 0 : chained.error().code(), c.error) << c.path;
      struct stat a, b;
      if (opened.ok() && chained.ok() && ::fstat(opened->get(), &a) == 0 && ::fstat(*chained, &b) == 0) {
        EXPECT_EQ(a.st_ino, b.st_ino) << c.path;
      }
    }
  }
  // A link planted where the chain had a directory is met, not followed,
  // once a path that differs earlier has been opened in between.
  Result<std::vector<std::string>> inD = SplitPathComponents("/real/d/x");
  ASSERT_TRUE(chain.open(*inD, 2).ok());
  ASSERT_EQ(::rename((root / "real").c_str(), (root / "moved").c_str()), 0);
  ASSERT_EQ(::symlink("moved", (root / "real").c_str()), 0);
  EXPECT_EQ(chain.open({"link"}, 1).error().code(), ELOOP);
  EXPECT_EQ(chain.open(*inD, 2).error().code(), ELOOP);
  // Creating on the way stops at a link too, and makes nothing behind it.
  Result<std::vector<std::string>> through = SplitPathComponents("/link/new/deeper");
  EXPECT_EQ(OpenDirectoryBeneath(rootFd.get(), *through, 3, true).error().code(), ELOOP);
  EXPECT_NE(::access((root / "real/new").c_str(), F_OK), 0);
}

}  // namespace
}  // namespace vtr::testing
