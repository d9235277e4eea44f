// The firmware-variable store on a plain folder, as the sandbox and the tests
// use it (the real efivarfs is exercised in a virtual machine, see
// tests/firmware).
#include "platform/nvram_store.h"

#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

#include <gtest/gtest.h>

#include "platform/unique_fd.h"
#include "tests/support/file_inspection.h"
#include "tests/support/test_support.h"

namespace vtr {
namespace {

using testing::ReadFile;
using testing::TempDir;
using testing::WriteFile;

constexpr char kSuffix[] = "-da3c1531-e7a2-45a1-875c-5c2980f00b0d";

std::span<const uint8_t> Bytes(std::string_view text) {
  return {reinterpret_cast<const uint8_t*>(text.data()), text.size()};
}

std::string Attributes() { return std::string("\x07\x00\x00\x00", 4); }

// The immutable flag of path; nullopt where the file system keeps none.
std::optional<bool> Immutable(const std::string& path) {
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  int flags = 0;
  if (!fd || ::ioctl(fd.get(), FS_IOC_GETFLAGS, &flags) != 0) return std::nullopt;
  return (flags & FS_IMMUTABLE_FL) != 0;
}

bool SetImmutable(const std::string& path, bool on) {
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  int flags = 0;
  if (!fd || ::ioctl(fd.get(), FS_IOC_GETFLAGS, &flags) != 0) return false;
  flags = on ? (flags | FS_IMMUTABLE_FL) : (flags & ~FS_IMMUTABLE_FL);
  return ::ioctl(fd.get(), FS_IOC_SETFLAGS, &flags) == 0;
}

class NvramStoreTest : public ::testing::Test {
 protected:
  NvramStore open() {
    Result<NvramStore> store = NvramStore::Open(AT_FDCWD, dir_.path());
    EXPECT_TRUE(store.ok()) << store.error().description();
    return std::move(store).value();
  }
  std::string file(const std::string& name) const { return dir_ / (name + kSuffix); }

  TempDir dir_;
};

TEST_F(NvramStoreTest, AWriteIsTheAttributesAndTheValueAndLeavesNoTail) {
  NvramStore store = open();
  ASSERT_TRUE(store.write("boot-args", Bytes("a long first value")).ok());
  EXPECT_EQ(ReadFile(file("boot-args")), Attributes() + "a long first value");
  ASSERT_TRUE(store.write("boot-args", Bytes("short")).ok());
  EXPECT_EQ(ReadFile(file("boot-args")), Attributes() + "short");
  const std::string accented = "d\xc3\xa9mo \xe2\x9c\x93";
  ASSERT_TRUE(store.write("text", Bytes(accented)).ok());
  EXPECT_EQ(store.read("text")->value(), std::vector<uint8_t>(accented.begin(), accented.end()));

  // Empty: no variable, whether there was one or not.
  ASSERT_TRUE(store.write("boot-args", {}).ok());
  EXPECT_FALSE(testing::Exists(file("boot-args")));
  ASSERT_TRUE(store.write("never-there", {}).ok());
  EXPECT_FALSE(testing::Exists(file("never-there")));
  EXPECT_EQ(store.read("never-there")->has_value(), false);

  Result<std::vector<NvramStore::Variable>> all = store.list();
  ASSERT_TRUE(all.ok());
  ASSERT_EQ(all->size(), 1u);
  EXPECT_EQ((*all)[0].name, "text");
  EXPECT_EQ((*all)[0].attributes, NvramStore::kAttributes);
}

TEST_F(NvramStoreTest, NamesThatAreNoVariableNamesTouchNothing) {
  NvramStore store = open();
  const std::string longest(NvramStore::kMaxNameBytes, 'n');
  EXPECT_TRUE(store.write(longest, Bytes("x")).ok());
  EXPECT_TRUE(store.remove(longest).ok());
  for (const std::string& name : {std::string(), std::string("/"), std::string("/etc/passwd"), std::string("a/b"),
                                  std::string("a\0b", 3), longest + "n", std::string("caf\xc3\xa9"),
                                  std::string("tab\there")}) {
    EXPECT_FALSE(NvramStore::IsValidName(name)) << name;
    EXPECT_EQ(store.write(name, Bytes("x")).error().code(), EINVAL) << name;
    EXPECT_EQ(store.remove(name).error().code(), EINVAL) << name;
  }
  EXPECT_TRUE(std::filesystem::is_empty(dir_.path()));
}

TEST_F(NvramStoreTest, NothingPlantedInTheFolderIsFollowedOrBlocksIt) {
  TempDir outside;
  WriteFile(outside / "target", "keep");
  ASSERT_EQ(::symlink((outside / "target").c_str(), file("link").c_str()), 0);
  ASSERT_EQ(::mkfifo(file("fifo").c_str(), 0600), 0);
  NvramStore store = open();
  for (const char* name : {"link", "fifo"}) {
    EXPECT_FALSE(store.write(name, Bytes("x")).ok()) << name;
    EXPECT_FALSE(store.read(name).ok()) << name;
  }
  EXPECT_EQ(ReadFile(outside / "target"), "keep");
  EXPECT_FALSE(store.list().ok());  // a listing does not pass over what it cannot read

  // The folder itself is reached without links and never made.
  ASSERT_EQ(::symlink(dir_.path().c_str(), (outside / "efivars").c_str()), 0);
  EXPECT_EQ(NvramStore::Open(AT_FDCWD, outside / "efivars").error().code(), ELOOP);
  EXPECT_EQ(NvramStore::Open(AT_FDCWD, outside / "missing").error().code(), ENOENT);
  EXPECT_FALSE(testing::Exists(outside / "missing"));
}

TEST_F(NvramStoreTest, AnImmutableVariableStaysImmutableAcrossAWrite) {
  WriteFile(file("locked"), Attributes() + "old");
  if (!SetImmutable(file("locked"), true)) GTEST_SKIP() << "no immutable flag here (needs root and a file system with flags)";
  NvramStore store = open();
  ASSERT_TRUE(store.write("locked", Bytes("new value")).ok());
  EXPECT_EQ(ReadFile(file("locked")), Attributes() + "new value");
  EXPECT_EQ(Immutable(file("locked")), true);
  // A variable that was not immutable is not made so.
  ASSERT_TRUE(store.write("open", Bytes("v")).ok());
  EXPECT_EQ(Immutable(file("open")).value_or(false), false);
  // Removing clears the flag first.
  ASSERT_TRUE(store.remove("locked").ok());
  EXPECT_FALSE(testing::Exists(file("locked")));
  EXPECT_TRUE(store.remove("locked").ok());  // already gone
}

}  // namespace
}  // namespace vtr
