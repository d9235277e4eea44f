#include "platform/fresh_file.h"

#include <fcntl.h>
#include <sys/random.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstdio>

namespace vtr {
namespace {

constexpr int kFreshFileFlags = O_RDWR | O_CLOEXEC;
constexpr mode_t kFreshFileMode = 0600;
// Names tried before giving up: a client that owns the directory may have
// made any name first.
constexpr int kNameAttempts = 16;

std::string UniqueName() {
  uint64_t random = 0;
  if (::getrandom(&random, sizeof random, 0) != sizeof random) random ^= static_cast<uint64_t>(::getpid());
  char name[40];
  std::snprintf(name, sizeof name, ".vitd-restore-%016llx", static_cast<unsigned long long>(random));
  return name;
}

// Calls attempt(name) with new names while it fails with EEXIST.
template <typename Attempt>
std::string TryNames(const Attempt& attempt) {
  for (int i = 0; i < kNameAttempts; ++i) {
    std::string name = UniqueName();
    if (attempt(name)) return name;
    if (errno != EEXIST) break;
  }
  return std::string();
}

}  // namespace

Result<FreshFile> FreshFile::MakeIn(int dirFd, const std::string& pathForErrors) {
  UniqueFd fd(::openat(dirFd, ".", O_TMPFILE | kFreshFileFlags, kFreshFileMode));
  if (fd) return FreshFile(dirFd, std::move(fd), std::string(), pathForErrors);
  // File systems without unnamed files answer one of these.
  if (errno != EOPNOTSUPP && errno != EISDIR && errno != EINVAL) return Error::FromErrno(pathForErrors);
  const std::string name = TryNames([&](const std::string& candidate) {
    fd.reset(::openat(dirFd, candidate.c_str(), O_CREAT | O_EXCL | O_NOFOLLOW | kFreshFileFlags, kFreshFileMode));
    return fd.valid();
  });
  if (name.empty()) return Error::FromErrno(pathForErrors);
  return FreshFile(dirFd, std::move(fd), name, pathForErrors);
}

FreshFile::FreshFile(FreshFile&& other) noexcept
    : dirFd_(other.dirFd_), fd_(std::move(other.fd_)), name_(std::move(other.name_)), path_(std::move(other.path_)) {
  other.name_.clear();
}

FreshFile::~FreshFile() {
  if (!name_.empty()) ::unlinkat(dirFd_, name_.c_str(), 0);
}

Status FreshFile::install(const std::string& name) {
  if (name_.empty()) {
    // An unnamed file gets a name of its own first (linkat of the
    // descriptor itself, which needs CAP_DAC_READ_SEARCH), then takes the
    // entry's in one rename.
    name_ = TryNames([&](const std::string& candidate) {
      return ::linkat(fd_.get(), "", dirFd_, candidate.c_str(), AT_EMPTY_PATH) == 0;
    });
    if (name_.empty()) return Error::FromErrno(path_);
  }
  if (::renameat(dirFd_, name_.c_str(), dirFd_, name.c_str()) != 0) return Error::FromErrno(path_);
  name_.clear();
  return Status::Ok();
}

}  // namespace vtr
