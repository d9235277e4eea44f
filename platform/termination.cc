#include "platform/termination.h"

#include <signal.h>
#include <sys/signalfd.h>
#include <unistd.h>

#include <atomic>

namespace vtr {
namespace {

std::atomic<bool> requested{false};
std::atomic<int> watchedFd{-1};

}  // namespace

void WatchTerminationSignal(int signalFd) {
  watchedFd.store(signalFd);
  requested.store(false);
}

void UnwatchTerminationSignal(int signalFd) {
  int expected = signalFd;
  watchedFd.compare_exchange_strong(expected, -1);
}

bool TerminationRequested() {
  if (requested.load(std::memory_order_relaxed)) return true;
  const int fd = watchedFd.load(std::memory_order_relaxed);
  if (fd < 0) return false;
  struct signalfd_siginfo info;
  while (::read(fd, &info, sizeof info) == sizeof info) {
    if (info.ssi_signo == SIGTERM) requested.store(true);
  }
  return requested.load();
}

bool TerminationRecorded() { return requested.load(std::memory_order_relaxed); }

void RequestTermination() { requested.store(true); }

}  // namespace vtr
