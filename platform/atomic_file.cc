#include "platform/atomic_file.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <random>

#include "platform/output_stream.h"
#include "platform/paths.h"

namespace vtr {
namespace {

std::string RandomSuffix() {
  static constexpr char kAlphabet[] = "abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789";
  thread_local std::mt19937_64 rng{std::random_device{}()};
  std::string s(6, 'x');
  for (char& c : s) c = kAlphabet[rng() % (sizeof kAlphabet - 1)];
  return s;
}

}  // namespace

Result<AtomicFile> AtomicFile::Create(const std::string& path, mode_t mode) {
  const PathParts parts = SplitLastComponent(path);
  if (parts.name.empty() || parts.name == "." || parts.name == "..") return Error(EINVAL, path);

  UniqueFd dirFd(::open(parts.parent.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!dirFd) return Error::FromErrno(parts.parent);
  return CreateIn(std::move(dirFd), path, mode);
}

Result<AtomicFile> AtomicFile::CreateIn(UniqueFd dirFd, const std::string& path, mode_t mode) {
  const auto [dir, name] = SplitLastComponent(path);
  if (name.empty() || name == "." || name == "..") return Error(EINVAL, path);
  // A file without a name first: a kill while it is written leaves nothing.
  // File systems without O_TMPFILE get a named one.
  if (UniqueFd fd(::openat(dirFd.get(), ".", O_TMPFILE | O_WRONLY | O_CLOEXEC, mode)); fd) {
    if (::fchmod(fd.get(), mode) != 0) return Error::FromErrno(path);
    return AtomicFile(std::move(dirFd), std::move(fd), path, name, std::string());
  }
  for (int attempt = 0; attempt < 100; ++attempt) {
    std::string temp = "." + name + "." + RandomSuffix();
    UniqueFd fd(::openat(dirFd.get(), temp.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, mode));
    if (fd) {
      // The mode given is meant whatever the umask.
      if (::fchmod(fd.get(), mode) != 0) {
        Error e = Error::FromErrno(path);
        ::unlinkat(dirFd.get(), temp.c_str(), 0);
        return e;
      }
      return AtomicFile(std::move(dirFd), std::move(fd), path, name, std::move(temp));
    }
    if (errno != EEXIST) return Error::FromErrno(dir + "/" + temp);
  }
  return Error(EEXIST, path);
}

AtomicFile::AtomicFile(UniqueFd dir, UniqueFd fd, std::string path, std::string name, std::string tempName)
    : dir_(std::move(dir)), fd_(std::move(fd)), path_(std::move(path)), name_(std::move(name)),
      tempName_(std::move(tempName)) {}

AtomicFile::AtomicFile(AtomicFile&& other) noexcept
    : dir_(std::move(other.dir_)), fd_(std::move(other.fd_)), path_(std::move(other.path_)),
      name_(std::move(other.name_)), tempName_(std::move(other.tempName_)), committed_(other.committed_) {
  other.committed_ = true;  // the moved-from object owns nothing to clean up
}

std::string AtomicFile::temporaryPath() const {
  if (tempName_.empty()) return std::string();
  const size_t slash = path_.rfind('/');
  return (slash == std::string::npos ? std::string() : path_.substr(0, slash + 1)) + tempName_;
}

AtomicFile::~AtomicFile() {
  if (!committed_ && dir_ && !tempName_.empty()) ::unlinkat(dir_.get(), tempName_.c_str(), 0);
}

Status AtomicFile::nameAnonymousFile() {
  const std::string viaProc = "/proc/self/fd/" + std::to_string(fd_.get());
  for (int attempt = 0; attempt < 100; ++attempt) {
    std::string temp = "." + name_ + "." + RandomSuffix();
    // AT_EMPTY_PATH needs CAP_DAC_READ_SEARCH; /proc serves the others.
    if (::linkat(fd_.get(), "", dir_.get(), temp.c_str(), AT_EMPTY_PATH) == 0 ||
        (errno != EEXIST &&
         ::linkat(AT_FDCWD, viaProc.c_str(), dir_.get(), temp.c_str(), AT_SYMLINK_FOLLOW) == 0)) {
      tempName_ = std::move(temp);
      return Status::Ok();
    }
    if (errno != EEXIST) return Error::FromErrno(path_);
  }
  return Error(EEXIST, path_);
}

Status AtomicFile::commit() {
  if (committed_) return Error(EINVAL, path_ + ": already committed");
  if (::fsync(fd_.get()) != 0) return Error::FromErrno(path_);
  // The name lives from here to the rename only; the helper removes such
  // names left by a kill at start-up.
  if (tempName_.empty()) {
    if (Status named = nameAnonymousFile(); !named.ok()) return named;
  }
  if (::renameat(dir_.get(), tempName_.c_str(), dir_.get(), name_.c_str()) != 0) return Error::FromErrno(path_);
  committed_ = true;
  fd_.reset();
  if (::fsync(dir_.get()) != 0) return Error::FromErrno(path_);
  return Status::Ok();
}

Status WriteFileAtomically(const std::string& path, std::span<const uint8_t> bytes, mode_t mode) {
  Result<AtomicFile> file = AtomicFile::Create(path, mode);
  if (!file.ok()) return file.error();
  if (Status s = WriteFully(file->fd(), bytes.data(), bytes.size()); !s.ok()) return Error(s.error().code(), path);
  return file->commit();
}

}  // namespace vtr
