// Helpers shared by the tests: temporary directories that clean up after
// themselves, and a capture of what the helper logs.
#ifndef VTR_TESTS_SUPPORT_TEST_SUPPORT_H_
#define VTR_TESTS_SUPPORT_TEST_SUPPORT_H_

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "platform/system_log.h"
#include "platform/value.h"
#include "xpc/xpc_object.h"

namespace vtr {

// How GoogleTest prints values in failure messages: their description.
void PrintTo(const Value& value, std::ostream* os);
void PrintTo(const XpcObject& object, std::ostream* os);

}  // namespace vtr

namespace vtr::testing {

// A fresh directory under $TMPDIR (or /tmp), removed with all its contents
// (never following symbolic links) when the object goes away.
class TempDir {
 public:
  TempDir();
  ~TempDir();
  TempDir(const TempDir&) = delete;
  TempDir& operator=(const TempDir&) = delete;

  const std::string& path() const { return path_; }
  // path() + "/" + relative
  std::string operator/(const std::string& relative) const { return path_ + "/" + relative; }
  // Leaves the folder in place when this goes (a forked child's copy).
  void keep() { path_.clear(); }

 private:
  std::string path_;
};

// Writes content to path (created or truncated); fails the test on error.
void WriteFile(const std::string& path, const std::string& content);
// The whole content of path; empty when unreadable.
std::string ReadFile(const std::string& path);
// Removes path and everything below it without following links.
void RemoveTree(const std::string& path);

// While alive, everything sent to the shared VTRLogModel's system log is kept
// here instead; the previous system log is put back afterwards.
class LogCapture {
 public:
  LogCapture();
  ~LogCapture();
  LogCapture(const LogCapture&) = delete;
  LogCapture& operator=(const LogCapture&) = delete;

  // What the day file would read: the journal's own explanations are left
  // out (journalOnly() has them).
  std::vector<std::string> messages() const { return log_->dayFileMessages(); }
  std::vector<std::string> journalOnly() const { return log_->journalOnlyMessages(); }
  bool contains(const std::string& message) const { return log_->contains(message); }
  void clear() { log_->clear(); }

 private:
  std::shared_ptr<MemorySystemLog> log_;
  std::shared_ptr<SystemLog> previous_;
};

// A tmpfs of size (as mount's "size=", e.g. "48m") mounted at path, an
// existing directory, for the life of the object and detached even when the
// test fails. ok() is false when it could not be mounted (needs root).
class TmpfsMount {
 public:
  TmpfsMount(const std::string& path, const std::string& size);
  ~TmpfsMount();
  TmpfsMount(const TmpfsMount&) = delete;
  TmpfsMount& operator=(const TmpfsMount&) = delete;
  bool ok() const { return ok_; }

 private:
  std::string path_;
  bool ok_ = false;
};

// True when the tests run as root (ownership and mount tests need it).
bool IsRoot();

// Sets or clears the immutable flag of path (a file or directory); false
// when the file system or the caller cannot.
bool SetImmutable(const std::string& path, bool on);

// Whether this build runs under the address sanitizer, which changes how
// much memory a process takes.
#if defined(__SANITIZE_ADDRESS__)
inline constexpr bool kUnderAddressSanitizer = true;
#elif defined(__has_feature)
inline constexpr bool kUnderAddressSanitizer = __has_feature(address_sanitizer);
#else
inline constexpr bool kUnderAddressSanitizer = false;
#endif

// Runs body in a forked child after setUp (which answers false when the child
// cannot be prepared) and returns what body returned, or a text in angle
// brackets saying what went wrong ("<fork failed>", "<child failed, ...>").
// For tests that change the process itself (credentials, seccomp filters).
std::string RunInChild(const std::function<bool()>& setUp, const std::function<std::string()>& body);

}  // namespace vtr::testing

#endif  // VTR_TESTS_SUPPORT_TEST_SUPPORT_H_
