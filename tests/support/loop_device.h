// Loop devices for tests that need a real block device (4096-byte sectors
// like the device's disk), and shell command lines to prepare them.
#ifndef VTR_TESTS_SUPPORT_LOOP_DEVICE_H_
#define VTR_TESTS_SUPPORT_LOOP_DEVICE_H_

#include <cstdint>
#include <string>

namespace vtr::testing {

// Runs a shell command line (its standard error discarded); its exit status,
// or -1 when it did not run or end normally. With output, what it printed.
int RunCommand(const std::string& command, std::string* output = nullptr);

// A loop device over a file, its partitions (when registered) removed and
// the device detached when the object goes away.
class LoopDevice {
 public:
  LoopDevice(const std::string& file, uint32_t blockSize);
  ~LoopDevice();
  LoopDevice(const LoopDevice&) = delete;
  LoopDevice& operator=(const LoopDevice&) = delete;

  // "/dev/loopN"; empty when none could be attached.
  const std::string& path() const { return path_; }
  // "/dev/loopNpK".
  std::string partition(int number) const { return path_ + "p" + std::to_string(number); }

 private:
  std::string path_;
};

}  // namespace vtr::testing

#endif  // VTR_TESTS_SUPPORT_LOOP_DEVICE_H_
