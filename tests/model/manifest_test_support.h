// Helpers of the manifest and tree-walk tests: trees deeper than path-based
// tools can handle, and running a piece of a test without root's power to
// read everything.
#ifndef VTR_TESTS_MODEL_MANIFEST_TEST_SUPPORT_H_
#define VTR_TESTS_MODEL_MANIFEST_TEST_SUPPORT_H_

#include <cstddef>
#include <functional>
#include <string>

namespace vtr::testing {

// A chain of nested directories, each named name, starting at parent/name:
// made by descriptor, so its depth is not bounded by PATH_MAX, and removed
// when the object goes away however deep it is (each level is moved up
// before its parent is removed, so no path grows long).
class DirectoryChain {
 public:
  DirectoryChain(std::string parent, std::string name, size_t levels);
  ~DirectoryChain();
  DirectoryChain(const DirectoryChain&) = delete;
  DirectoryChain& operator=(const DirectoryChain&) = delete;

  // Whether every level could be made.
  bool made() const { return made_; }

 private:
  std::string parent_;
  std::string name_;
  bool made_ = false;
};

// Forks; the child drops to user and group "nobody" (65534) when it runs as
// root, runs body, and hands back what it answered (empty when all checks
// passed, else what went wrong). The answer of a child that failed says so.
std::string RunUnprivileged(const std::function<std::string()>& body);

}  // namespace vtr::testing

#endif  // VTR_TESTS_MODEL_MANIFEST_TEST_SUPPORT_H_
