// Running a piece of the helper in a child process in which some system
// calls always fail, to reach error paths that a real file system does not
// offer on demand (an extended-attribute list that cannot be read, a file
// that root cannot open).
#ifndef VTR_TESTS_SUPPORT_FAILING_SYSCALL_H_
#define VTR_TESTS_SUPPORT_FAILING_SYSCALL_H_

#include <linux/filter.h>

#include <functional>
#include <string>
#include <vector>

namespace vtr::testing {

// True when this machine's architecture is known to the filter.
bool CanFailSyscalls();

// A seccomp filter that makes the system calls `numbers` fail with `error`,
// built ahead so that a forked child (where allocating is not safe) only
// installs it, e.g. before it executes a program that should meet the
// failures.
class FailingSyscalls {
 public:
  FailingSyscalls(const std::vector<long>& numbers, int error);
  // Installs the filter in the calling process, for good; false when it
  // cannot be installed. Allocates nothing.
  bool install();

 private:
  std::vector<struct sock_filter> program_;
};

// Forks; in the child, makes the system calls `numbers` fail with `error` (a
// seccomp filter) and runs body. Returns the text body returned, or a text
// in angle brackets saying how the child failed.
std::string RunWithFailingSyscalls(const std::vector<long>& numbers, int error,
                                   const std::function<std::string()>& body);

}  // namespace vtr::testing

#endif  // VTR_TESTS_SUPPORT_FAILING_SYSCALL_H_
