#include "model/log_model.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <optional>
#include <utility>
#include <vector>

#include "platform/file_dates.h"
#include "platform/file_tree.h"
#include "platform/item_io.h"
#include "platform/open_beneath.h"
#include "platform/paths.h"
#include "platform/remove_item.h"

namespace vtr {
namespace {

constexpr char kProbeName[] = "testWritability.log";

// Where this thread's messages go instead of being written (ScopedLogDiversion).
thread_local std::vector<LogLine>* t_divertedMessages = nullptr;
// The peer whose lines this thread logs (ScopedLogPeer).
thread_local std::optional<uint32_t> t_logPeer;
// Failures this thread has logged (failuresLoggedOnThisThread).
thread_local uint64_t t_failuresLogged = 0;

// Budgets of peers not heard from for this long are forgotten.
constexpr auto kPeerBudgetIdle = std::chrono::minutes(5);
constexpr size_t kMaxPeerBudgets = 4096;

// "~/x" becomes "$HOME/x"; other paths stay as they are.
std::string ExpandTilde(const std::string& path) {
  if (path.empty() || path[0] != '~' || (path.size() > 1 && path[1] != '/')) return path;
  const char* home = std::getenv("HOME");
  return std::string(home ? home : "") + path.substr(1);
}

// message cut to the longest line, the rest counted.
std::string_view CapLine(std::string_view message, std::string* holder) {
  if (message.size() <= VTRLogModel::kMaxLogLineBytes) return message;
  const size_t kept = VTRLogModel::kMaxLogLineBytes - 64;
  *holder = std::string(message.substr(0, kept)) + Format(" ... (%zu more bytes)", message.size() - kept);
  return *holder;
}

}  // namespace

VTRLogModel& VTRLogModel::sharedInstance() {
  static VTRLogModel* const instance = new VTRLogModel(MakeSyslog(), SystemClock());
  return *instance;
}

VTRLogModel::VTRLogModel(std::shared_ptr<SystemLog> systemLog, std::shared_ptr<Clock> clock)
    : systemLog_(std::move(systemLog)), clock_(std::move(clock)) {}

void VTRLogModel::logMessage(std::string_view message, LogPriority priority) {
  if (t_divertedMessages != nullptr) {
    t_divertedMessages->push_back({std::string(message), priority});
    return;
  }
  std::string holder;
  message = CapLine(message, &holder);
  if (priority != LogPriority::kNotice) ++t_failuresLogged;
  if (t_logPeer) {
    uint64_t suppressed = 0;
    if (!admitPeerLine(*t_logPeer, &suppressed)) return;
    if (suppressed > 0) {
      writeLine(Format("%llu lines caused by uid %u were suppressed", static_cast<unsigned long long>(suppressed),
                       *t_logPeer),
                LogPriority::kNotice);
    }
  }
  writeLine(message, priority);
}

void VTRLogModel::writeLine(std::string_view message, LogPriority priority) {
  std::shared_ptr<SystemLog> systemLog;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    if (logFP_ != nullptr && priority != LogPriority::kJournalError) {
      appendLine(Format("%@ %@\n", clock_->now(), message));
    }
    systemLog = systemLog_;
  }
  systemLog->write(message, priority);
}

void VTRLogModel::appendLine(const std::string& line) {
  const int fd = ::fileno(logFP_);
  if (fd < 0) {  // a stream without a descriptor (set by a caller): written as a stream
    std::fputs(line.c_str(), logFP_);
    std::fflush(logFP_);
    return;
  }
  // One write(2) on the append-mode descriptor: the line lands whole at the
  // end, or, when the disk fills part way, the part is cut off again, so
  // that no later line is glued to a fragment. A fragment that cannot be
  // cut off is closed by the next line, which then begins on a line of its
  // own.
  const std::string broken = lineOpen_ ? "\n" + line : std::string();
  const std::string_view text = lineOpen_ ? std::string_view(broken) : std::string_view(line);
  struct stat before;
  const bool sized = ::fstat(fd, &before) == 0;
  ssize_t written;
  do {
    written = ::write(fd, text.data(), text.size());
  } while (written < 0 && errno == EINTR);
  if (written < 0) return;  // nothing written (a full disk): nothing to undo
  if (static_cast<size_t>(written) == text.size()) {
    lineOpen_ = false;
    return;
  }
  if (!sized || ::ftruncate(fd, before.st_size) != 0) lineOpen_ = true;
}

uint64_t VTRLogModel::failuresLoggedOnThisThread() { return t_failuresLogged; }

bool VTRLogModel::admitPeerLine(uint32_t peer, uint64_t* suppressed) {
  const auto now = std::chrono::steady_clock::now();
  std::lock_guard<std::mutex> lock(mutex_);
  if (peerBudgets_.size() >= kMaxPeerBudgets) {
    std::erase_if(peerBudgets_, [now](const auto& entry) { return now - entry.second.refilled > kPeerBudgetIdle; });
  }
  PeerBudget& budget = peerBudgets_[peer];
  const double elapsed = std::chrono::duration<double>(now - budget.refilled).count();
  budget.lines = std::min(kPeerBurstLines, budget.lines + elapsed * kPeerLinesPerSecond);
  budget.refilled = now;
  if (budget.lines < 1) {
    ++budget.suppressed;
    return false;
  }
  budget.lines -= 1;
  *suppressed = std::exchange(budget.suppressed, 0);
  return true;
}

void VTRLogModel::systemLogOnly(std::string_view message, LogPriority priority) {
  systemLog()->write(message, priority);
}

UniqueFd VTRLogModel::openLogFolder(const std::string& directory) {
  Result<std::vector<std::string>> components = SplitPathComponents(directory);
  if (!components.ok()) return UniqueFd();
  UniqueFd root = OpenAt(AT_FDCWD, "/", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  Result<UniqueFd> folder = OpenDirectoryBeneath(root.get(), *components, components->size(), true, 0755);
  if (!folder.ok()) return UniqueFd();
  struct stat st;
  if (!StatOf(folder->get(), &st)) return UniqueFd();
  if (st.st_uid != ThisUser() || (st.st_mode & 022) != 0) {
    systemLogOnly(
        Format("The log folder %s is owned by uid %u with mode %04o, not by this user and closed to others; "
               "logging to the system log only",
               directory, st.st_uid, st.st_mode & 07777));
    return UniqueFd();
  }
  return std::move(*folder);
}

bool VTRLogModel::openDayFile(int folder, const std::string& name, const std::string& path) {
  // Read too: the file's last byte says whether an earlier run left a
  // fragment there.
  UniqueFd fd = OpenAt(folder, name, O_RDWR | O_APPEND | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC, 0644);
  struct stat st;
  FILE* fp = nullptr;
  bool endsInFragment = false;
  if (fd && StatOf(fd.get(), &st) && S_ISREG(st.st_mode) && st.st_uid == ThisUser() && st.st_nlink == 1) {
    char last = '\n';
    endsInFragment = st.st_size > 0 && ::pread(fd.get(), &last, 1, st.st_size - 1) == 1 && last != '\n';
    fp = ::fdopen(fd.get(), "a");
    if (fp != nullptr) fd.release();
  } else if (fd || errno == ELOOP) {
    // Someone else's file, a link, a fifo: never written through.
    systemLogOnly(
        Format("The log file %s is not a regular file of this user with one link; "
               "logging to the system log only",
               path));
  }
  std::lock_guard<std::mutex> lock(mutex_);
  logFP_ = fp;
  lineOpen_ = endsInFragment;
  return fp != nullptr;
}

bool VTRLogModel::enableLogToFile(const std::string& path) {
  const std::string expanded = ExpandTilde(path);
  if (expanded.find('/') == std::string::npos) return false;
  const PathParts parts = SplitLastComponent(expanded);
  UniqueFd folder = openLogFolder(parts.parent);
  if (!folder) return false;
  return openDayFile(folder.get(), parts.name, expanded);
}

bool VTRLogModel::logToFileEnabled() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return logFP_ != nullptr;
}

bool VTRLogModel::enableLogToFilesUnder(const std::string& directory, const std::string& prefix, long expireDays) {
  UniqueFd folder = openLogFolder(directory);
  if (!folder || !ProbeWritable(folder.get(), kProbeName)) return false;

  std::shared_ptr<Clock> clock;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    clock = clock_;
  }
  const Date cutoff{clock->now().secondsSince2001 - static_cast<double>(expireDays) * 86400.0};
  // A directory that cannot be listed is not swept. Entries are looked at and
  // removed relative to the folder, never followed.
  if (Result<std::vector<std::string>> names = DirectoryEntryNames(folder.get(), directory); names.ok()) {
    std::sort(names->begin(), names->end());
    for (const std::string& name : *names) {
      const std::string fullPath = Format("%@/%@", directory, name);
      systemLogOnly(FormatEscaped("Checking existing log file (full path) %@ against %@", fullPath, cutoff),
                    LogPriority::kNotice);
      const std::optional<Date> created = CreationDateOfItemAt(folder.get(), name);
      if (created && *created < cutoff) {
        systemLogOnly(FormatEscaped("Removing %@ whose creation date is %@.", fullPath, *created),
                      LogPriority::kNotice);
        (void)RemoveItemAt(folder.get(), name, fullPath);
      }
    }
  }
  const std::string path = fileNameForTodayUnder(directory, prefix);
  return openDayFile(folder.get(), path.substr(path.rfind('/') + 1), path);
}

std::string VTRLogModel::fileNameForTodayUnder(const std::string& directory, const std::string& prefix) const {
  std::shared_ptr<Clock> clock;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    clock = clock_;
  }
  const CivilTime today = LocalCivilTime(clock->now());
  return Format("%@/%@-%4ld%02ld%02ld.log", directory, prefix, static_cast<long>(today.year),
                static_cast<long>(today.month), static_cast<long>(today.day));
}

FILE* VTRLogModel::logFP() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return logFP_;
}

void VTRLogModel::setLogFP(FILE* fp) {
  std::lock_guard<std::mutex> lock(mutex_);
  logFP_ = fp;
  lineOpen_ = false;
}

void VTRLogModel::setSystemLog(std::shared_ptr<SystemLog> systemLog) {
  std::lock_guard<std::mutex> lock(mutex_);
  systemLog_ = std::move(systemLog);
}

std::shared_ptr<SystemLog> VTRLogModel::systemLog() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return systemLog_;
}

void VTRLogModel::setClock(std::shared_ptr<Clock> clock) {
  std::lock_guard<std::mutex> lock(mutex_);
  clock_ = std::move(clock);
}

ScopedLogDiversion::ScopedLogDiversion(std::vector<LogLine>* messages)
    : previous_(std::exchange(t_divertedMessages, messages)) {}

ScopedLogDiversion::~ScopedLogDiversion() { t_divertedMessages = previous_; }

ScopedLogPeer::ScopedLogPeer(std::optional<uint32_t> peer) : previous_(std::exchange(t_logPeer, peer)) {}

ScopedLogPeer::~ScopedLogPeer() { t_logPeer = previous_; }

}  // namespace vtr
