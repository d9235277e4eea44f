#include "tests/support/failing_syscall.h"
#include "tests/support/test_support.h"

#include <linux/audit.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstddef>

namespace vtr::testing {
namespace {

#if defined(__x86_64__)
constexpr uint32_t kAuditArch = AUDIT_ARCH_X86_64;
#elif defined(__aarch64__)
constexpr uint32_t kAuditArch = AUDIT_ARCH_AARCH64;
#else
constexpr uint32_t kAuditArch = 0;
#endif

}  // namespace

FailingSyscalls::FailingSyscalls(const std::vector<long>& numbers, int error) {
  // arch check, then one comparison per call; a match jumps to the last
  // instruction, which fails the call.
  const size_t n = numbers.size();
  program_ = {
      BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(struct seccomp_data, arch)),
      BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, kAuditArch, 1, 0),
      BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW),
      BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(struct seccomp_data, nr)),
  };
  for (size_t i = 0; i < n; ++i) {
    program_.push_back(BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, static_cast<uint32_t>(numbers[i]),
                                static_cast<uint8_t>(n - i), 0));
  }
  program_.push_back(BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW));
  program_.push_back(BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ERRNO | (static_cast<uint32_t>(error) & SECCOMP_RET_DATA)));
}

bool FailingSyscalls::install() {
  struct sock_fprog program = {static_cast<unsigned short>(program_.size()), program_.data()};
  return ::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0 &&
         ::prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &program, 0, 0) == 0;
}

bool CanFailSyscalls() { return kAuditArch != 0; }

std::string RunWithFailingSyscalls(const std::vector<long>& numbers, int error,
                                   const std::function<std::string()>& body) {
  FailingSyscalls filter(numbers, error);
  return RunInChild([&] { return filter.install(); }, body);
}

}  // namespace vtr::testing
