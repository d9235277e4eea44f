// The data-partition commands end to end, on a loop device with 4096-byte
// sectors: a GPT of three entries ("System", "Data" at table position 1,
// "Update"), the Zarn signature, the data file system mounted as the
// sandbox's /private/var, the disk's nodes in the sandbox's /dev and /sys
// bound read-only. Every check reads the disk as other tools do: both GPT
// copies by their CRCs, sfdisk's dump, sgdisk's verdict, the kernel's
// partition sizes in sysfs and the file system's own size.
#include <fcntl.h>
#include <linux/capability.h>
#include <sys/file.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <map>
#include <memory>
#include <regex>
#include <sstream>

#include <gtest/gtest.h>

#include "platform/block_geometry.h"
#include "platform/make_directories.h"
#include "platform/unique_fd.h"
#include "storage/file_system_resize.h"
#include "storage/gpt_disk.h"
#include "tests/support/failing_syscall.h"
#include "tests/support/loop_device.h"
#include "tests/support/test_support.h"
#include "tests/vitd_helper/helper_sandbox.h"

namespace vtr::testing {
namespace {

constexpr uint64_t kSector = 4096;
constexpr uint64_t kDiskBytes = uint64_t{3} << 30;
// The usable range sfdisk leaves on it: from 1 MiB, up to the backup table
// and header in the last two sectors.
constexpr uint64_t kFirstUsable = 256;
constexpr uint64_t kLastUsable = kDiskBytes / kSector - 3;

struct Entry {
  std::string name;
  uint64_t start = 0;  // sectors
  uint64_t size = 0;
};

// System and Update first, Data (table position 1) last with free space
// after it: the layout the device has.
const std::vector<Entry> kDeviceLayout = {{"System", 256, 16384}, {"Data", 33024, 262144}, {"Update", 16640, 16384}};

// sfdisk's dump of the disk, entry by name.
std::map<std::string, Entry> Dump(const std::string& device) {
  std::string text;
  RunCommand("sfdisk --dump " + device, &text);
  std::map<std::string, Entry> entries;
  const std::regex line(R"(start=\s*(\d+), size=\s*(\d+),.*name="([^"]*)\")");
  std::istringstream lines(text);
  for (std::string l; std::getline(lines, l);) {
    std::smatch m;
    if (std::regex_search(l, m, line)) entries[m[3]] = Entry{m[3], std::stoull(m[1]), std::stoull(m[2])};
  }
  return entries;
}

// sfdisk's header lines: the disk's GUID, the usable range, the table's
// length.
std::string DumpHeader(const std::string& device) {
  std::string text, header;
  RunCommand("sfdisk --dump " + device, &text);
  std::istringstream lines(text);
  for (std::string l; std::getline(lines, l);) {
    for (const char* key : {"label-id:", "first-lba:", "last-lba:", "table-length:"}) {
      if (l.rfind(key, 0) == 0) header += l + "\n";
    }
  }
  return header;
}

uint64_t SysfsNumber(const std::string& path) {
  const std::string text = ReadFile(path);
  return text.empty() ? 0 : std::stoull(text);
}

// Whether this process holds the capability (its effective set).
bool HasCapability(int capability) {
  std::istringstream status(ReadFile("/proc/self/status"));
  for (std::string line; std::getline(status, line);) {
    if (line.rfind("CapEff:", 0) == 0) return (std::stoull(line.substr(7), nullptr, 16) >> capability) & 1;
  }
  return false;
}

class DataPartitionTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (!IsRoot()) GTEST_SKIP() << "loop devices, mounts and the helper's chroot need root";
    for (const char* tool : {"losetup", "sfdisk", "sgdisk", "partx", "mkfs.btrfs", "mkfs.ext4"}) {
      if (RunCommand(std::string("command -v ") + tool) != 0) GTEST_SKIP() << "missing " << tool;
    }
  }

  void TearDown() override {
    if (sandbox_.running()) sandbox_.terminate();
    for (auto it = mounts_.rbegin(); it != mounts_.rend(); ++it) {
      if (::umount(it->c_str()) != 0) ::umount2(it->c_str(), MNT_DETACH);
    }
    mounts_.clear();
    loop_.reset();
  }

  // Builds the disk and the sandbox around it: layout's entries in table
  // order, the signature when signed, the "Data" entry formatted with
  // fsType and mounted as /private/var unless mount is false. False (after
  // a skip or a failure) when the disk could not be made.
  bool makeDisk(const std::vector<Entry>& layout, bool signed_ = true, const std::string& fsType = "btrfs",
                bool mount = true) {
    const std::string image = images_ / "disk.img";
    if (::truncate(image.c_str(), 0) != 0 && RunCommand("truncate -s 0 " + image) != 0) return false;
    EXPECT_EQ(RunCommand("truncate -s " + std::to_string(kDiskBytes) + " " + image), 0);
    loop_ = std::make_unique<LoopDevice>(image, kSector);
    if (loop_->path().empty()) {
      skipped_ = "no loop device could be attached (losetup -f)";
      return false;
    }
    std::string script = "label: gpt\ntable-length: " + std::to_string(layout.size()) + "\nsector-size: 4096\n";
    for (const Entry& e : layout) {
      script += "start=" + std::to_string(e.start) + ", size=" + std::to_string(e.size) + ", name=" + e.name + "\n";
    }
    WriteFile(images_ / "layout", script);
    EXPECT_EQ(RunCommand("sfdisk -q --no-reread --no-tell-kernel " + loop_->path() + " < " + (images_ / "layout")), 0);
    if (signed_) {
      EXPECT_EQ(RunCommand("printf nraZ | dd of=" + loop_->path() + " bs=1 seek=440 conv=notrunc status=none"), 0);
    }
    EXPECT_EQ(RunCommand("partx -a " + loop_->path()), 0);
    dataNumber_ = 0;
    for (size_t i = 0; i < layout.size(); ++i) {
      if (layout[i].name == "Data") dataNumber_ = static_cast<int>(i) + 1;
    }
    if (dataNumber_ > 0) {
      const std::string data = loop_->partition(dataNumber_);
      // Each mkfs forces its own way over what may be on the partition.
      EXPECT_EQ(RunCommand("mkfs." + fsType + (fsType == "ext4" ? " -q -F " : " -q -f ") + data), 0) << fsType;
      if (mount) {
        EXPECT_EQ(::mount(data.c_str(), sandbox_.host("/private/var").c_str(), fsType.c_str(), 0, nullptr), 0);
        mounts_.push_back(sandbox_.host("/private/var"));
        EXPECT_TRUE(MakeDirectories(sandbox_.host("/private/var/logs")).ok());
      }
    }
    // The disk's nodes and /sys, as the operator provides them.
    EXPECT_TRUE(MakeDirectories(sandbox_.host("/dev")).ok());
    EXPECT_TRUE(MakeDirectories(sandbox_.host("/sys")).ok());
    auto node = [&](const std::string& device, const std::string& at) {
      struct stat st;
      ASSERT_EQ(::stat(device.c_str(), &st), 0) << device;
      ::unlink(sandbox_.host(at).c_str());  // a node of the disk made before
      ASSERT_EQ(::mknod(sandbox_.host(at).c_str(), S_IFBLK | 0600, st.st_rdev), 0) << at;
    };
    node(loop_->path(), "/dev/rdisk0s1");
    for (size_t i = 1; i <= layout.size(); ++i) {
      node(loop_->partition(static_cast<int>(i)), loop_->partition(static_cast<int>(i)));
    }
    EXPECT_EQ(::mount("/sys", sandbox_.host("/sys").c_str(), nullptr, MS_BIND, nullptr), 0);
    mounts_.insert(mounts_.begin(), sandbox_.host("/sys"));
    EXPECT_EQ(::mount(nullptr, sandbox_.host("/sys").c_str(), nullptr, MS_BIND | MS_REMOUNT | MS_RDONLY, nullptr), 0);
    mbr_ = firstBlocks(1);
    dumpHeader_ = DumpHeader(loop_->path());
    return !::testing::Test::HasFailure() && sandbox_.start();
  }

  std::optional<bool> command(const std::string& key) {
    std::vector<XpcObject> replies =
        sandbox_.request(XpcObject::Dictionary({{key, XpcObject::Bool(true)}}), 1, std::chrono::seconds(60));
    size_t responses = 0;
    std::optional<bool> answer;
    for (const XpcObject& reply : replies) {
      if (const XpcObject* r = reply.find("Response")) {
        ++responses;
        answer = r->boolValue();
      }
    }
    EXPECT_LE(responses, 1u);
    return answer;
  }

  bool dayLogHas(const std::string& line) const {
    std::istringstream lines(ReadFile(sandbox_.dayLogPath()));
    for (std::string l; std::getline(lines, l);) {
      if (l.size() >= line.size() && l.compare(l.size() - line.size(), line.size(), line) == 0) return true;
    }
    return false;
  }

  GptValidity validity() const {
    UniqueFd fd(::open(loop_->path().c_str(), O_RDONLY | O_CLOEXEC));
    Result<GptValidity> checked = CheckGpt(fd.get(), kSector, kDiskBytes / kSector);
    EXPECT_TRUE(checked.ok());
    return checked.ok() ? *checked : GptValidity();
  }

  // The data partition as the kernel sees it, in sectors of 4096 bytes.
  Entry kernelData() const {
    const std::string base = "/sys/class/block/" + loop_->partition(dataNumber_).substr(5);
    return Entry{"Data", SysfsNumber(base + "/start") / 8, SysfsNumber(base + "/size") / 8};
  }

  uint64_t fileSystemBytes() const {
    Result<MountedFileSystem> fs =
        DescribeMountedFileSystem(sandbox_.host("/private/var"), loop_->partition(dataNumber_));
    EXPECT_TRUE(fs.ok());
    return fs.ok() ? fs->bytes : 0;
  }

  // Everything a successful resize must leave: the entry where it was with
  // the size asked for, the kernel agreeing, the file system no larger than
  // its partition and within 1 MiB of it, both GPT copies valid, the other
  // entries as they were.
  void expectResizedTo(uint64_t sectors, const std::map<std::string, Entry>& before) {
    const std::map<std::string, Entry> after = Dump(loop_->path());
    ASSERT_EQ(after.count("Data"), 1u);
    EXPECT_EQ(after.at("Data").start, before.at("Data").start);
    EXPECT_EQ(after.at("Data").size, sectors);
    EXPECT_EQ(kernelData().start, after.at("Data").start);
    EXPECT_EQ(kernelData().size, sectors);
    const uint64_t partitionBytes = sectors * kSector;
    EXPECT_LE(fileSystemBytes(), partitionBytes);
    EXPECT_GE(fileSystemBytes() + (uint64_t{1} << 20), partitionBytes);
    EXPECT_TRUE(validity().valid());
    for (const auto& [name, entry] : before) {
      if (name == "Data") continue;
      EXPECT_EQ(after.at(name).start, entry.start) << name;
      EXPECT_EQ(after.at(name).size, entry.size) << name;
    }
    // The MBR with its signature, the disk's GUID and usable range stay.
    EXPECT_EQ(firstBlocks(1), mbr_);
    EXPECT_EQ(DumpHeader(loop_->path()), dumpHeader_);
    std::string verdict;
    RunCommand("sgdisk -v " + loop_->path(), &verdict);
    EXPECT_NE(verdict.find("No problems found"), std::string::npos) << verdict;
  }

  // For a disk the command (expand unless said) must not change: it answers
  // false with line in the log, and every entry stays as it was in a valid
  // table.
  void expectRefusedAndUnchanged(const std::string& line, const std::string& key = "expandDataPartition:") {
    const std::map<std::string, Entry> before = Dump(loop_->path());
    EXPECT_EQ(command(key), false);
    EXPECT_NE(ReadFile(sandbox_.dayLogPath()).find(line), std::string::npos) << sandbox_.log();
    const std::map<std::string, Entry> after = Dump(loop_->path());
    for (const auto& [name, entry] : before) {
      EXPECT_EQ(after.at(name).start, entry.start) << name;
      EXPECT_EQ(after.at(name).size, entry.size) << name;
    }
    EXPECT_TRUE(validity().valid());
  }

  // The disk's first count blocks.
  std::string firstBlocks(size_t count) const {
    std::string bytes(count * kSector, '\0');
    UniqueFd fd(::open(loop_->path().c_str(), O_RDONLY | O_CLOEXEC));
    EXPECT_EQ(::pread(fd.get(), bytes.data(), bytes.size(), 0), static_cast<ssize_t>(bytes.size()));
    return bytes;
  }

  // The number a log line "PREFIX<number>..." carries.
  uint64_t loggedNumber(const std::string& prefix) const {
    const std::string log = ReadFile(sandbox_.dayLogPath());
    const size_t at = log.rfind(prefix);
    return at == std::string::npos ? 0 : std::stoull(log.substr(at + prefix.size()));
  }

  HelperSandbox sandbox_;
  TempDir images_;
  std::unique_ptr<LoopDevice> loop_;
  std::vector<std::string> mounts_;
  int dataNumber_ = 0;
  std::string skipped_;
  std::string mbr_;         // the first block as made
  std::string dumpHeader_;  // sfdisk's header lines as made
};

#define MAKE_DISK_OR_SKIP(...)                                            \
  if (!makeDisk(__VA_ARGS__)) {                                           \
    if (!skipped_.empty()) GTEST_SKIP() << skipped_;                      \
    FAIL() << "the disk could not be made ready\n" << sandbox_.log();     \
  }

TEST_F(DataPartitionTest, BtrfsShrinksThenGrowsWithItsDataIntact) {
  MAKE_DISK_OR_SKIP(kDeviceLayout);
  std::string content;
  for (int i = 0; i < 1 << 16; ++i) content += std::to_string(i * 2654435761u) + "\n";
  WriteFile(sandbox_.host("/private/var/content"), content);
  const std::map<std::string, Entry> before = Dump(loop_->path());

  ASSERT_EQ(command("shrinkDataPartition:"), true) << sandbox_.log();
  const uint64_t newSize = loggedNumber("newSize = ");
  EXPECT_GT(newSize, 0u);
  expectResizedTo((newSize + kSector - 1) / kSector, before);
  EXPECT_TRUE(dayLogHas("matched " + loop_->partition(2) + " on /private/var")) << sandbox_.log();
  EXPECT_TRUE(dayLogHas("Wrote GPT header back to disk"));

  ASSERT_EQ(command("expandDataPartition:"), true) << sandbox_.log();
  // Every usable block the other two leave.
  const uint64_t blocks = loggedNumber("Block numbers that could be used as data partition = ");
  EXPECT_EQ(blocks, (kLastUsable - kFirstUsable + 1) - 2 * 16384);
  expectResizedTo(blocks, before);
  EXPECT_EQ(ReadFile(sandbox_.host("/private/var/content")), content);

  // zarnutil shows the disk as the helper saw it, the mounted file system too.
  HelperSandbox::RunResult shown =
      sandbox_.run(std::string(VTR_BINARY_DIR) + "/bin/zarnutil", {"disk", loop_->path(), "--json"});
  EXPECT_EQ(shown.status, 0);
  for (const std::string& part : {std::string("\"gptValid\":true"), std::string("\"zarnSignature\":true"),
                                  "\"mountPoint\":\"" + sandbox_.host("/private/var") + "\"",
                                  "\"type\":\"btrfs\",\"bytes\":" + std::to_string(fileSystemBytes()),
                                  "\"name\":\"Data\",\"first\":33024,\"last\":" + std::to_string(33024 + blocks - 1)}) {
    EXPECT_NE(shown.output.find(part), std::string::npos) << part << "\n" << shown.output;
  }

  // Once more: nothing to do, nothing written.
  const std::string table = firstBlocks(3);
  ASSERT_EQ(command("expandDataPartition:"), true);
  EXPECT_TRUE(dayLogHas("no change in size"));
  EXPECT_EQ(firstBlocks(3), table);
}

// ext4 and xfs: a shrink is refused in words before the table is touched;
// a growth works online.
#define EXPECT_GROWS_ONLY(fsType, refusal)                                                                   \
  do {                                                                                                       \
    MAKE_DISK_OR_SKIP(kDeviceLayout, true, fsType);                                                          \
    const std::map<std::string, Entry> before = Dump(loop_->path());                                         \
    ASSERT_EQ(command("shrinkDataPartition:"), false);                                                       \
    EXPECT_TRUE(dayLogHas(refusal)) << sandbox_.log();                                                       \
    EXPECT_TRUE(dayLogHas("can't shrink partition 1, currently mounted on /private/var"));                   \
    EXPECT_EQ(Dump(loop_->path()).at("Data").size, before.at("Data").size);                                  \
    EXPECT_FALSE(dayLogHas("Wrote GPT header back to disk"));                                                \
    ASSERT_EQ(command("expandDataPartition:"), true) << sandbox_.log();                                      \
    expectResizedTo(loggedNumber("Block numbers that could be used as data partition = "), before);          \
  } while (false)

TEST_F(DataPartitionTest, Ext4GrowsOnlineAndRefusesToShrinkBeforeTheTableIsTouched) {
  // Growing ext4 online takes CAP_SYS_RESOURCE, which some machines (and
  // containers) withhold even from root.
  if (!HasCapability(CAP_SYS_RESOURCE)) GTEST_SKIP() << "no CAP_SYS_RESOURCE here: ext4 cannot grow online";
  EXPECT_GROWS_ONLY("ext4", "an ext4 file system cannot shrink while it is mounted");
}

TEST_F(DataPartitionTest, XfsGrowsOnlineAndRefusesToShrinkBeforeTheTableIsTouched) {
  if (RunCommand("command -v mkfs.xfs") != 0) GTEST_SKIP() << "missing mkfs.xfs";
  EXPECT_GROWS_ONLY("xfs", "an xfs file system cannot shrink");
}

TEST_F(DataPartitionTest, Ext4RefusesToShrinkEvenWithoutTheRightToGrow) {
  MAKE_DISK_OR_SKIP(kDeviceLayout, true, "ext4");
  ASSERT_EQ(command("shrinkDataPartition:"), false);
  EXPECT_TRUE(dayLogHas("an ext4 file system cannot shrink while it is mounted")) << sandbox_.log();
  EXPECT_TRUE(validity().valid());
  EXPECT_EQ(Dump(loop_->path()).at("Data").size, kDeviceLayout[1].size);
}

TEST_F(DataPartitionTest, AFailedTableWriteAfterTheShrinkLeavesAConsistentDisk) {
  if (!CanFailSyscalls()) GTEST_SKIP() << "no seccomp filter for this architecture";
  sandbox_.failSyscalls({SYS_pwrite64}, EIO);
  MAKE_DISK_OR_SKIP(kDeviceLayout);
  const std::map<std::string, Entry> before = Dump(loop_->path());
  ASSERT_EQ(command("shrinkDataPartition:"), false);
  EXPECT_TRUE(dayLogHas("failed to write GPT header and table to /dev/rdisk0s1 (return -1). errno=5 : "
                        "Input/output error"))
      << sandbox_.log();
  // The file system shrank, the table did not: it still fits its partition.
  EXPECT_EQ(Dump(loop_->path()).at("Data").size, before.at("Data").size);
  EXPECT_EQ(kernelData().size, before.at("Data").size);
  EXPECT_LT(fileSystemBytes(), before.at("Data").size * kSector);
  EXPECT_TRUE(validity().valid());
}

TEST_F(DataPartitionTest, AWriterHoldingTheDiskMakesTheCommandFailNotWait) {
  MAKE_DISK_OR_SKIP(kDeviceLayout);
  // The lock partitioning tools take, on the node the helper was given.
  UniqueFd holder(::open(sandbox_.host("/dev/rdisk0s1").c_str(), O_RDONLY | O_CLOEXEC));
  ASSERT_EQ(::flock(holder.get(), LOCK_EX), 0);
  const auto start = std::chrono::steady_clock::now();
  ASSERT_EQ(command("expandDataPartition:"), false);
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(10));
  EXPECT_TRUE(dayLogHas("Failed to open /dev/rdisk0s1 to write new GPT header out to disk.")) << sandbox_.log();
  EXPECT_TRUE(validity().valid());
}

TEST_F(DataPartitionTest, ADiskWithoutTheSignatureIsNotManaged) {
  MAKE_DISK_OR_SKIP(kDeviceLayout, /*signed_=*/false);
  expectRefusedAndUnchanged("/dev/rdisk0s1 not managed by Zarn");
}

TEST_F(DataPartitionTest, AnUnmountedDataPartitionIsNotResized) {
  MAKE_DISK_OR_SKIP(kDeviceLayout, true, "btrfs", /*mount=*/false);
  expectRefusedAndUnchanged("filesystem must be mounted (mountPoint=(null),which=1,nPartitions=3,newSize=");
}

TEST_F(DataPartitionTest, ALayoutThatWouldMoveAPartitionIsRefusedBeforeTheFileSystemChanges) {
  const struct {
    std::vector<Entry> layout;
    std::string key;
    std::string line;
  } cases[] = {
      {{{"System", 256, 16384}, {"Data", 16640, 262144}, {"Update", 278784, 16384}}, "expandDataPartition:",
       "the new layout would move the start of partition 2"},
      // A 1 MiB gap before Data, which the re-packing would close.
      {{{"System", 256, 16384}, {"Data", 33280, 262144}, {"Update", 16640, 16384}}, "shrinkDataPartition:",
       "the new layout would move the start of partition 1"},
      {{{"System", 256, 16384}, {"Data", 33280, 262144}, {"Update", 16640, 16384}}, "expandDataPartition:",
       "the new layout would move the start of partition 1"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.key + " " + c.line);
    TearDown();
    MAKE_DISK_OR_SKIP(c.layout);
    const uint64_t bytes = fileSystemBytes();
    expectRefusedAndUnchanged(c.line, c.key);
    EXPECT_EQ(fileSystemBytes(), bytes);
  }
}

TEST_F(DataPartitionTest, ATornPrimaryTableIsNeverTheSourceOfANewOne) {
  // A power cut while the primary table was written leaves it not matching
  // its header's CRC, the backup whole: a resize from the torn copy would
  // overwrite the one sound copy first.
  MAKE_DISK_OR_SKIP(kDeviceLayout);
  UniqueFd disk(::open(loop_->path().c_str(), O_WRONLY | O_CLOEXEC));
  ASSERT_EQ(::pwrite(disk.get(), "X", 1, 2 * kSector + 56), 1);  // "System" becomes "Xystem"
  ASSERT_EQ(::fsync(disk.get()), 0);
  const uint64_t bytes = fileSystemBytes();
  EXPECT_EQ(command("shrinkDataPartition:"), false);
  EXPECT_TRUE(dayLogHas("The primary GPT of /dev/rdisk0s1 does not match its CRCs; the sound backup copy is left as "
                        "it is"))
      << sandbox_.log();
  EXPECT_EQ(fileSystemBytes(), bytes);
  const GptValidity after = validity();
  EXPECT_FALSE(after.primaryTableCrc);
  EXPECT_TRUE(after.backupHeaderCrc && after.backupTableCrc);
}

TEST_F(DataPartitionTest, WithoutADataEntryANewPartitionIsMadeAfterTheOthers) {
  MAKE_DISK_OR_SKIP({{"System", 256, 16384}});
  ASSERT_EQ(command("expandDataPartition:"), true) << sandbox_.log();
  EXPECT_TRUE(dayLogHas("Creating new partition instead of adjusting existing one"));
  const std::map<std::string, Entry> after = Dump(loop_->path());
  ASSERT_EQ(after.count("New"), 1u);
  EXPECT_EQ(after.at("New").start, 16640u);
  EXPECT_EQ(after.at("New").size, kLastUsable - 16640 + 1);
  EXPECT_TRUE(validity().valid());
  // The kernel knows it as partition 2.
  const std::string base = "/sys/class/block/" + loop_->partition(2).substr(5);
  EXPECT_EQ(SysfsNumber(base + "/start") / 8, after.at("New").start);
  EXPECT_EQ(SysfsNumber(base + "/size") / 8, after.at("New").size);
}

}  // namespace
}  // namespace vtr::testing
