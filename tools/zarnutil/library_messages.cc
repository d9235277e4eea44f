#include "tools/zarnutil/library_messages.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <unistd.h>

#include <cstdio>
#include <string_view>

namespace vtr {

LibraryMessages::LibraryMessages() {
  std::fflush(stderr);
  UniqueFd memory(::memfd_create("zarn-messages", MFD_CLOEXEC));
  UniqueFd saved(::fcntl(STDERR_FILENO, F_DUPFD_CLOEXEC, 3));
  if (!memory || !saved || ::dup2(memory.get(), STDERR_FILENO) < 0) return;
  saved_ = std::move(saved);
  captured_ = std::move(memory);
}

LibraryMessages::~LibraryMessages() { finish(); }

std::vector<std::string> LibraryMessages::finish() {
  std::vector<std::string> lines;
  if (!saved_) return lines;
  std::fflush(stderr);
  ::dup2(saved_.get(), STDERR_FILENO);
  saved_.reset();
  std::string text;
  char buffer[4096];
  for (off_t at = 0;;) {
    const ssize_t n = ::pread(captured_.get(), buffer, sizeof buffer, at);
    if (n <= 0) break;
    text.append(buffer, static_cast<size_t>(n));
    at += n;
  }
  captured_.reset();
  std::string_view rest = text;
  while (!rest.empty()) {
    const size_t end = rest.find('\n');
    std::string_view line = rest.substr(0, end);
    rest.remove_prefix(end == std::string_view::npos ? rest.size() : end + 1);
    if (line.starts_with("zarn: ")) line.remove_prefix(6);
    lines.emplace_back(line);
  }
  return lines;
}

void ReplayLibraryMessages(const std::vector<std::string>& lines) {
  for (const std::string& line : lines) std::fprintf(stderr, "zarn: %s\n", line.c_str());
}

}  // namespace vtr
