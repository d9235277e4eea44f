#include "tests/support/loop_device.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/wait.h>

#include <array>
#include <cstdio>

#include "platform/unique_fd.h"

namespace vtr::testing {

int RunCommand(const std::string& command, std::string* output) {
  FILE* pipe = ::popen((command + " 2>/dev/null").c_str(), "r");
  if (pipe == nullptr) return -1;
  std::array<char, 256> buffer;
  std::string text;
  while (std::fgets(buffer.data(), buffer.size(), pipe) != nullptr) text += buffer.data();
  const int status = ::pclose(pipe);
  if (output != nullptr) *output = text;
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

LoopDevice::LoopDevice(const std::string& file, uint32_t blockSize) {
  // Tests run in parallel: finding a free device and attaching it is done
  // by one of them at a time.
  UniqueFd lock(::open("/tmp/vtr-loop-devices.lock", O_RDWR | O_CREAT | O_CLOEXEC, 0600));
  if (lock) ::flock(lock.get(), LOCK_EX);
  std::string out;
  if (RunCommand("losetup -f --show -b " + std::to_string(blockSize) + " " + file, &out) == 0 && !out.empty()) {
    path_ = out.substr(0, out.find('\n'));
  }
}

LoopDevice::~LoopDevice() {
  if (path_.empty()) return;
  RunCommand("partx -d " + path_);
  RunCommand("losetup -d " + path_);
}

}  // namespace vtr::testing
