#include "platform/nvram_store.h"

#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>

#include "platform/file_tree.h"
#include "platform/open_beneath.h"
#include "platform/read_fully.h"

namespace vtr {
namespace {

// Larger than any variable a firmware keeps (they hold tens of KiB at most).
constexpr size_t kMaxVariableBytes = size_t{1} << 20;

// The immutable flag of the file open as fd; false where the file system
// keeps no flags.
bool IsImmutable(int fd) {
  int flags = 0;
  return ::ioctl(fd, FS_IOC_GETFLAGS, &flags) == 0 && (flags & FS_IMMUTABLE_FL) != 0;
}

Status SetImmutable(int fd, bool immutable, const std::string& path) {
  int flags = 0;
  if (::ioctl(fd, FS_IOC_GETFLAGS, &flags) != 0) return Error::FromErrno(path);
  flags = immutable ? (flags | FS_IMMUTABLE_FL) : (flags & ~FS_IMMUTABLE_FL);
  if (::ioctl(fd, FS_IOC_SETFLAGS, &flags) != 0) return Error::FromErrno(path);
  return Status::Ok();
}

// The existing variable file of the folder, opened read-only (enough for
// its flags); an invalid descriptor when there is none.
Result<UniqueFd> OpenExisting(int folder, const std::string& file, const std::string& path) {
  Result<UniqueFd> fd = OpenEntryNoFollow(folder, file, O_RDONLY, path);
  if (!fd.ok()) {
    if (fd.error().code() == ENOENT) return UniqueFd();
    return fd.error();
  }
  struct stat st;
  if (::fstat(fd->get(), &st) != 0) return Error::FromErrno(path);
  if (!S_ISREG(st.st_mode)) return Error(EINVAL, path + " is not a variable");
  return fd;
}

// Creates or replaces the file with bytes in one write(2).
Status WriteOnce(int folder, const std::string& file, std::span<const uint8_t> bytes, const std::string& path) {
  UniqueFd out(::openat(folder, file.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC, 0644));
  if (!out) return Error::FromErrno(path);
  struct stat st;
  if (::fstat(out.get(), &st) != 0) return Error::FromErrno(path);
  if (!S_ISREG(st.st_mode)) return Error(EINVAL, path + " is not a variable");
  const ssize_t n = ::write(out.get(), bytes.data(), bytes.size());
  if (n < 0) return Error::FromErrno(path);
  if (static_cast<size_t>(n) != bytes.size()) return Error(EIO, path + ": the value was written in part");
  return Status::Ok();
}

}  // namespace

bool NvramStore::IsValidName(std::string_view name) {
  if (name.empty() || name.size() > kMaxNameBytes) return false;
  return std::all_of(name.begin(), name.end(), [](char c) { return c >= 0x20 && c < 0x7F && c != '/'; });
}

Result<NvramStore> NvramStore::Open(int rootFd, const std::string& path) {
  Result<std::vector<std::string>> components = SplitPathComponents(path);
  if (!components.ok()) return components.error();
  UniqueFd ownRoot;
  if (rootFd == AT_FDCWD) {
    ownRoot.reset(::open("/", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!ownRoot) return Error::FromErrno("/");
    rootFd = ownRoot.get();
  }
  Result<UniqueFd> folder = OpenDirectoryBeneath(rootFd, *components, components->size());
  if (!folder.ok()) return folder.error();
  return NvramStore(std::move(*folder), path);
}

std::string NvramStore::fileName(std::string_view name) const {
  std::string file(name);
  file += '-';
  file += kVendorGuid;
  return file;
}

Status NvramStore::write(std::string_view name, std::span<const uint8_t> value) const {
  if (!IsValidName(name)) return Error(EINVAL, "not a variable name");
  if (value.empty()) return remove(name);  // the firmware holds no empty variable
  if (value.size() > kMaxVariableBytes) return Error(EFBIG, std::string(name) + ": value too large");
  const std::string file = fileName(name);
  const std::string path = path_ + "/" + file;
  Result<UniqueFd> existing = OpenExisting(folder_.get(), file, path);
  if (!existing.ok()) return existing.error();
  const bool wasImmutable = existing->valid() && IsImmutable(existing->get());
  if (wasImmutable) {
    if (Status cleared = SetImmutable(existing->get(), false, path); !cleared.ok()) return cleared;
  }
  std::vector<uint8_t> record(4 + value.size());
  for (int i = 0; i < 4; ++i) record[i] = static_cast<uint8_t>(kAttributes >> (8 * i));
  std::copy(value.begin(), value.end(), record.begin() + 4);
  // One write(2): one SetVariable. O_TRUNC matters to a plain folder only.
  const Status written = WriteOnce(folder_.get(), file, record, path);
  // The flag comes back whatever happened: a variable that was immutable
  // stays so.
  if (wasImmutable) {
    Status restored = SetImmutable(existing->get(), true, path);
    if (written.ok() && !restored.ok()) return restored;
  }
  return written;
}

Status NvramStore::remove(std::string_view name) const {
  if (!IsValidName(name)) return Error(EINVAL, "not a variable name");
  const std::string file = fileName(name);
  const std::string path = path_ + "/" + file;
  Result<UniqueFd> existing = OpenExisting(folder_.get(), file, path);
  if (!existing.ok()) return existing.error();
  if (!existing->valid()) return Status::Ok();
  if (IsImmutable(existing->get())) {
    if (Status cleared = SetImmutable(existing->get(), false, path); !cleared.ok()) return cleared;
  }
  if (::unlinkat(folder_.get(), file.c_str(), 0) != 0 && errno != ENOENT) return Error::FromErrno(path);
  return Status::Ok();
}

Result<std::optional<NvramStore::Variable>> NvramStore::readFile(const std::string& file) const {
  const std::string path = path_ + "/" + file;
  Result<UniqueFd> fd = OpenExisting(folder_.get(), file, path);
  if (!fd.ok()) return fd.error();
  if (!fd->valid()) return std::optional<Variable>();
  Result<std::string> bytes = ReadFully(fd->get(), 4 + kMaxVariableBytes);
  if (!bytes.ok()) return bytes.error();
  // An empty file is a variable being made or a failed write's leftover
  // (efivarfs shows one until the next mount): no variable.
  if (bytes->empty()) return std::optional<Variable>();
  if (bytes->size() < 4) return Error(EINVAL, path + ": shorter than its attributes");
  Variable variable;
  for (int i = 0; i < 4; ++i) variable.attributes |= uint32_t{static_cast<uint8_t>((*bytes)[i])} << (8 * i);
  variable.value.assign(bytes->begin() + 4, bytes->end());
  return std::optional<Variable>(std::move(variable));
}

Result<std::optional<std::vector<uint8_t>>> NvramStore::read(std::string_view name) const {
  if (!IsValidName(name)) return Error(EINVAL, "not a variable name");
  Result<std::optional<Variable>> variable = readFile(fileName(name));
  if (!variable.ok()) return variable.error();
  if (!*variable) return std::optional<std::vector<uint8_t>>();
  return std::optional<std::vector<uint8_t>>(std::move((*variable)->value));
}

Result<std::vector<NvramStore::Variable>> NvramStore::list() const {
  Result<std::vector<std::string>> files = DirectoryEntryNames(folder_.get(), path_);
  if (!files.ok()) return files.error();
  std::vector<std::string> names;
  const std::string suffix = "-" + std::string(kVendorGuid);
  for (const std::string& file : *files) {
    if (file.size() > suffix.size() && file.ends_with(suffix)) names.push_back(file.substr(0, file.size() - suffix.size()));
  }
  std::sort(names.begin(), names.end());
  std::vector<Variable> variables;
  for (std::string& name : names) {
    Result<std::optional<Variable>> variable = readFile(fileName(name));
    if (!variable.ok()) return variable.error();
    if (!*variable) continue;
    (*variable)->name = std::move(name);
    variables.push_back(std::move(**variable));
  }
  return variables;
}

}  // namespace vtr
