#include "tests/support/test_support.h"

#include <fcntl.h>
#include <ftw.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <fstream>
#include <sstream>

#include <gtest/gtest.h>

#include "model/log_model.h"

namespace vtr {

void PrintTo(const Value& value, std::ostream* os) { *os << value.description(); }

void PrintTo(const XpcObject& object, std::ostream* os) {
  switch (object.type()) {
    case XpcObject::Type::kDictionary: {
      *os << "{";
      const char* separator = "";
      for (const auto& [key, item] : *object.dictionary()) {
        *os << separator << '"' << key << "\": ";
        PrintTo(item, os);
        separator = ", ";
      }
      *os << "}";
      break;
    }
    case XpcObject::Type::kArray: {
      *os << "[";
      const char* separator = "";
      for (const XpcObject& item : *object.array()) {
        *os << separator;
        PrintTo(item, os);
        separator = ", ";
      }
      *os << "]";
      break;
    }
    case XpcObject::Type::kBool: *os << (*object.boolValue() ? "true" : "false"); break;
    case XpcObject::Type::kInt64: *os << *object.int64Value(); break;
    case XpcObject::Type::kUint64: *os << *object.uint64Value() << "u"; break;
    case XpcObject::Type::kDouble: *os << *object.doubleValue(); break;
    case XpcObject::Type::kString: *os << '"' << *object.string() << '"'; break;
    default: *os << "<" << XpcTypeName(object.type()) << ">";
  }
}

}  // namespace vtr

namespace vtr::testing {

TempDir::TempDir() {
  const char* base = std::getenv("TMPDIR");
  std::string pattern = std::string(base && *base ? base : "/tmp") + "/vtr-test-XXXXXX";
  if (::mkdtemp(pattern.data()) == nullptr) {
    ADD_FAILURE() << "mkdtemp failed";
  }
  path_ = pattern;
}

TempDir::~TempDir() {
  if (!path_.empty()) RemoveTree(path_);
}

void RemoveTree(const std::string& path) {
  // Make everything writable first so that read-only directories go too.
  ::nftw(
      path.c_str(),
      [](const char* p, const struct stat* st, int type, struct FTW*) {
        if (type == FTW_D || type == FTW_DNR) ::chmod(p, (st->st_mode & 07777) | 0700);
        return 0;
      },
      64, FTW_PHYS);
  ::nftw(
      path.c_str(), [](const char* p, const struct stat*, int, struct FTW*) { return ::remove(p) == 0 ? 0 : 0; }, 64,
      FTW_PHYS | FTW_DEPTH);
}

void WriteFile(const std::string& path, const std::string& content) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  ASSERT_TRUE(out.good()) << "cannot write " << path;
  out << content;
}

std::string ReadFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  std::stringstream ss;
  ss << in.rdbuf();
  return ss.str();
}

LogCapture::LogCapture() : log_(std::make_shared<MemorySystemLog>()) {
  previous_ = VTRLogModel::sharedInstance().systemLog();
  VTRLogModel::sharedInstance().setSystemLog(log_);
}

LogCapture::~LogCapture() { VTRLogModel::sharedInstance().setSystemLog(previous_); }

TmpfsMount::TmpfsMount(const std::string& path, const std::string& size) : path_(path) {
  ok_ = ::mount("tmpfs", path.c_str(), "tmpfs", 0, ("size=" + size + ",mode=0755").c_str()) == 0;
}

TmpfsMount::~TmpfsMount() {
  if (ok_) ::umount2(path_.c_str(), MNT_DETACH);
}

bool IsRoot() { return ::geteuid() == 0; }

bool SetImmutable(const std::string& path, bool on) {
  const int fd = ::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC);
  int flags = 0;
  bool done = fd >= 0 && ::ioctl(fd, FS_IOC_GETFLAGS, &flags) == 0;
  flags = on ? (flags | FS_IMMUTABLE_FL) : (flags & ~FS_IMMUTABLE_FL);
  done = done && ::ioctl(fd, FS_IOC_SETFLAGS, &flags) == 0;
  if (fd >= 0) ::close(fd);
  return done;
}

std::string RunInChild(const std::function<bool()>& setUp, const std::function<std::string()>& body) {
  int fds[2];
  if (::pipe(fds) != 0) return "<pipe failed>";
  const pid_t pid = ::fork();
  if (pid < 0) return "<fork failed>";
  if (pid == 0) {
    ::close(fds[0]);
    if (!setUp()) ::_exit(3);
    const std::string result = body();
    ::_exit(::write(fds[1], result.data(), result.size()) == static_cast<ssize_t>(result.size()) ? 0 : 2);
  }
  ::close(fds[1]);
  std::string result;
  char buffer[512];
  for (ssize_t n; (n = ::read(fds[0], buffer, sizeof buffer)) > 0;) result.append(buffer, static_cast<size_t>(n));
  ::close(fds[0]);
  int status = 0;
  if (::waitpid(pid, &status, 0) != pid) return "<waitpid failed>";
  if (!WIFEXITED(status) || WEXITSTATUS(status) != 0) return "<child failed, status " + std::to_string(status) + ">";
  return result;
}

}  // namespace vtr::testing
