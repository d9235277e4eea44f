// VTRLogModel: where every diagnostic of the helper goes. Each message is
// copied to the system log and, once file logging is on, appended with a UTC
// time stamp to one log file per start-up day. File logging is switched on
// once, at start-up, after a sweep of old entries from the log directory.
//
// The helper writes its files as root in a folder it shares with nobody: the
// folder must be a directory of the helper's own user that group and others
// cannot write (created 0755 when missing), and the day's file is opened
// relative to it without following a link, and used only when it is a
// regular file of the helper's own user with one link. Otherwise file
// logging stays off and the system log says why.
//
// Every line is one line: the formatted values have their control
// characters escaped (FormatEscaped), and a message longer than
// kMaxLogLineBytes is cut, the rest replaced by a count. Lines caused by one
// peer (ScopedLogPeer) are rate-limited: a burst, then one line counting
// what was suppressed once lines flow again.
//
// Thread safety: logMessage() may be called from any thread; writing and
// flushing the file happen under the model's one lock, the system-log copy
// outside it. The set-up calls (enable..., set...) are made before serving.
#ifndef VTR_MODEL_LOG_MODEL_H_
#define VTR_MODEL_LOG_MODEL_H_

#include <chrono>
#include <cstdint>
#include <cstdio>
#include <memory>
#include <optional>
#include <unordered_map>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

#include "platform/clock.h"
#include "platform/format.h"
#include "platform/system_log.h"
#include "platform/unique_fd.h"

namespace vtr {

class VTRLogModel {
 public:
  // The process-wide model, created once: system log = syslog, real clock.
  static VTRLogModel& sharedInstance();

  VTRLogModel(std::shared_ptr<SystemLog> systemLog, std::shared_ptr<Clock> clock);
  VTRLogModel(const VTRLogModel&) = delete;
  VTRLogModel& operator=(const VTRLogModel&) = delete;
  // The stream is never closed (it lives as long as the process); a model
  // made for a test closes nothing either, the test owns the stream.
  ~VTRLogModel() = default;

  // Longest line written; the rest of a longer message is replaced by a count.
  static constexpr size_t kMaxLogLineBytes = 64 * 1024;
  // Lines one peer may cause in a burst, and per second after it.
  static constexpr double kPeerBurstLines = 200;
  static constexpr double kPeerLinesPerSecond = 20;

  // Formats the message, values escaped, and writes it (see logMessage).
  template <typename... Args>
  void logWithFormat(LogPriority priority, FormatString<std::type_identity_t<Args>...> format, const Args&... args) {
    logMessage(FormatEscaped(format, args...), priority);
  }

  // Appends "<date description> <message>\n" to the log file when file
  // logging is on (never for kJournalError), with one write(2), so the line
  // lands whole or not at all (a full disk), and sends the message alone to
  // the system log in every case, with its priority.
  void logMessage(std::string_view message, LogPriority priority = LogPriority::kNotice);

  // How many failures (kError or kJournalError) the calling thread has
  // logged so far, diverted ones once they are written: a command that
  // answers NO without one can be told apart.
  static uint64_t failuresLoggedOnThisThread();

  // Opens path for appending (created if missing, never truncated), creating
  // its parent directory if needed. Returns false when the parent cannot be
  // created or is not safe (the stream is left as it was) or the file cannot
  // be opened or is not safe (the stream becomes null).
  bool enableLogToFile(const std::string& path);
  bool logToFileEnabled() const;

  // The start-up set-up: creates directory if missing, probes that it is
  // writable (a file "testWritability.log" holding "a", removed at once),
  // removes every entry of the directory created more than expireDays days
  // ago (a directory with its contents), then opens today's file. Returns
  // false, with file logging left off, when the directory cannot be created
  // or written.
  bool enableLogToFilesUnder(const std::string& directory, const std::string& prefix, long expireDays);

  // "<directory>/<prefix>-YYYYMMDD.log" for today's local date; the year is
  // padded with spaces to four places.
  std::string fileNameForTodayUnder(const std::string& directory, const std::string& prefix) const;

  FILE* logFP() const;
  // Plain assignment: the earlier stream is not closed.
  void setLogFP(FILE* fp);

  // Where the system-log copy goes (syslog by default; standard error with
  // the daemon's --stderr; a memory log in tests).
  void setSystemLog(std::shared_ptr<SystemLog> systemLog);
  std::shared_ptr<SystemLog> systemLog() const;
  void setClock(std::shared_ptr<Clock> clock);

 private:
  struct PeerBudget {
    double lines = kPeerBurstLines;
    std::chrono::steady_clock::time_point refilled = std::chrono::steady_clock::now();
    uint64_t suppressed = 0;
  };

  // The system log alone, as the expiry sweep reports (a failure unless
  // told otherwise).
  void systemLogOnly(std::string_view message, LogPriority priority = LogPriority::kError);
  // Writes one line to the file and the system log.
  void writeLine(std::string_view message, LogPriority priority);
  // Appends line to the file whole or not at all (under the lock).
  void appendLine(const std::string& line);
  // Whether a line caused by peer may be written now; *suppressed becomes
  // the count of lines held back before it (to be reported first).
  bool admitPeerLine(uint32_t peer, uint64_t* suppressed);
  // The folder of the log files opened (created when missing) and checked,
  // or an invalid fd after the system log said why.
  UniqueFd openLogFolder(const std::string& directory);
  // Opens name in folder for appending, checked (see above).
  bool openDayFile(int folder, const std::string& name, const std::string& path);

  mutable std::mutex mutex_;  // the one lock: file writes and flushes, peer budgets
  FILE* logFP_ = nullptr;
  // The file ends in a fragment of a line that could not be cut off.
  bool lineOpen_ = false;
  std::unordered_map<uint32_t, PeerBudget> peerBudgets_;
  std::shared_ptr<SystemLog> systemLog_;
  std::shared_ptr<Clock> clock_;
};

// While alive, what is logged on the thread that made it is appended to
// *messages instead of being written; the owner logs the messages later with
// logMessage(). Work moved to a helper thread thereby logs at the point where
// doing it in sequence would have. Diversions nest: the innermost one
// collects until it ends. Must end on the thread that made it.
class ScopedLogDiversion {
 public:
  explicit ScopedLogDiversion(std::vector<LogLine>* messages);
  ~ScopedLogDiversion();
  ScopedLogDiversion(const ScopedLogDiversion&) = delete;
  ScopedLogDiversion& operator=(const ScopedLogDiversion&) = delete;

 private:
  std::vector<LogLine>* previous_;
};

// While alive, lines logged on the thread that made it are caused by peer
// (its uid) and rate-limited as such; nullopt marks work that is not any
// peer's to limit (an entitled client's command). Scopes nest.
class ScopedLogPeer {
 public:
  explicit ScopedLogPeer(std::optional<uint32_t> peer);
  ~ScopedLogPeer();
  ScopedLogPeer(const ScopedLogPeer&) = delete;
  ScopedLogPeer& operator=(const ScopedLogPeer&) = delete;

 private:
  std::optional<uint32_t> previous_;
};

}  // namespace vtr

#endif  // VTR_MODEL_LOG_MODEL_H_
