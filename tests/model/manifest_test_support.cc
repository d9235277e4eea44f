#include "tests/model/manifest_test_support.h"
#include "tests/support/test_support.h"

#include <fcntl.h>
#include <grp.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <vector>

#include "platform/remove_item.h"
#include "platform/unique_fd.h"

namespace vtr::testing {
namespace {

constexpr uid_t kNobody = 65534;
constexpr char kSpareName[] = ".chain-spare";
// Levels of a chain opened at once while it is removed.
constexpr size_t kBatch = 256;

}  // namespace

DirectoryChain::DirectoryChain(std::string parent, std::string name, size_t levels)
    : parent_(std::move(parent)), name_(std::move(name)) {
  UniqueFd dir(::open(parent_.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  for (size_t i = 0; i < levels && dir; ++i) {
    if (::mkdirat(dir.get(), name_.c_str(), 0755) != 0) return;
    dir.reset(::openat(dir.get(), name_.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  }
  made_ = dir.valid();
}

DirectoryChain::~DirectoryChain() {
  UniqueFd top(::open(parent_.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!top) return;
  for (;;) {
    // Up to kBatch levels are opened; what lies below them is moved up to
    // the top (one rename, however deep), so that the opened levels can be
    // removed bottom-up by descriptor.
    std::vector<UniqueFd> levels;
    while (levels.size() < kBatch) {
      UniqueFd level(::openat(levels.empty() ? top.get() : levels.back().get(), name_.c_str(),
                              O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
      if (!level) break;
      levels.push_back(std::move(level));
    }
    if (levels.empty()) return;
    const bool deeper = levels.size() == kBatch &&
                        ::renameat(levels.back().get(), name_.c_str(), top.get(), kSpareName) == 0;
    // The bottom level may hold more than the chain.
    for (size_t k = levels.size(); k-- > 0;) {
      const int parentFd = k == 0 ? top.get() : levels[k - 1].get();
      if (k + 1 == levels.size()) {
        (void)RemoveItemAt(parentFd, name_, parent_ + "/...");
      } else if (::unlinkat(parentFd, name_.c_str(), AT_REMOVEDIR) != 0) {
        return;
      }
    }
    if (!deeper || ::renameat(top.get(), kSpareName, top.get(), name_.c_str()) != 0) return;
  }
}

std::string RunUnprivileged(const std::function<std::string()>& body) {
  return RunInChild([&] { return ::geteuid() != 0 || (::setgroups(0, nullptr) == 0 && ::setgid(kNobody) == 0 && ::setuid(kNobody) == 0); }, body);
}

}  // namespace vtr::testing
