#include "xpc/listener.h"

#include <fcntl.h>
#include <pthread.h>
#include <signal.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/resource.h>
#include <sys/signalfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/timerfd.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cstdlib>
#include <cstring>
#include <optional>
#include <string_view>
#include <vector>
#include <utility>

#include "platform/format.h"
#include "platform/termination.h"

namespace vtr {
namespace {

constexpr uint64_t kListeningToken = 0;
constexpr uint64_t kSignalToken = 1;
constexpr uint64_t kTimerToken = 2;
constexpr uint64_t kWakeupToken = 3;
constexpr uint64_t kHousekeepingToken = 4;
constexpr uint64_t kFirstConnectionToken = 16;
constexpr int kMaxEventsPerWait = 64;
// Bounds the accepts per wake-up so that a flood of connections cannot keep
// the loop from reading the ones it has.
constexpr int kMaxAcceptsPerWakeup = 32;
// Descriptors a connection holds: its socket, a pidfd, its /proc directory.
constexpr size_t kFdsPerConnection = 3;
constexpr int kSystemdFirstFd = 3;

Status EpollControl(int epoll, int op, int fd, uint32_t events, uint64_t token) {
  struct epoll_event event = {};
  event.events = events;
  event.data.u64 = token;
  if (::epoll_ctl(epoll, op, fd, &event) != 0) return Error::FromErrno("epoll_ctl");
  return Status::Ok();
}

void RaiseOpenFileLimit(size_t wanted) {
  struct rlimit limit;
  if (::getrlimit(RLIMIT_NOFILE, &limit) != 0 || limit.rlim_cur >= wanted) return;
  limit.rlim_cur = limit.rlim_max == RLIM_INFINITY ? wanted : std::min<rlim_t>(wanted, limit.rlim_max);
  ::setrlimit(RLIMIT_NOFILE, &limit);
}

std::optional<long> EnvironmentNumber(const char* name) {
  const char* text = std::getenv(name);
  if (text == nullptr) return std::nullopt;
  std::string_view view(text);
  long value = 0;
  auto [ptr, ec] = std::from_chars(view.data(), view.data() + view.size(), value);
  if (ec != std::errc() || ptr != view.data() + view.size()) return std::nullopt;
  return value;
}

bool SystemdPassedSocket() {
  std::optional<long> pid = EnvironmentNumber("LISTEN_PID");
  std::optional<long> fds = EnvironmentNumber("LISTEN_FDS");
  return pid && fds && *pid == ::getpid() && *fds >= 1;
}

Result<int> SocketOption(int fd, int option, const char* name) {
  int value = 0;
  socklen_t length = sizeof value;
  if (::getsockopt(fd, SOL_SOCKET, option, &value, &length) != 0) return Error::FromErrno(name);
  return value;
}

// EADDRINUSE when a server takes connections at address, OK when no one
// listens there (ECONNREFUSED), the error of the connection otherwise.
Status ProbeServer(const struct sockaddr_un& address) {
  UniqueFd probe(::socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0));
  if (!probe) return Error::FromErrno("socket");
  if (::connect(probe.get(), reinterpret_cast<const struct sockaddr*>(&address), sizeof address) == 0 ||
      errno == EAGAIN) {
    return Error(EADDRINUSE, "a server listens");
  }
  if (errno != ECONNREFUSED) return Error::FromErrno("connect");
  return Status::Ok();
}

// Removes a socket left at path by an earlier run. A path that is not a
// socket is left alone, and so is a socket that someone still listens on.
Status RemoveStaleSocket(const std::string& path, const struct sockaddr_un& address) {
  struct stat st;
  if (::lstat(path.c_str(), &st) != 0) {
    return errno == ENOENT ? Status::Ok() : Status(Error::FromErrno("lstat " + path));
  }
  if (!S_ISSOCK(st.st_mode)) return Error(EEXIST, path + " exists and is not a socket");
  if (Status probed = ProbeServer(address); !probed) {
    return probed.error().code() == EADDRINUSE ? Error(EADDRINUSE, "another server listens at " + path)
                                               : Error(probed.error().code(), "connect " + path);
  }
  if (::unlink(path.c_str()) != 0 && errno != ENOENT) return Error::FromErrno("unlink " + path);
  return Status::Ok();
}

}  // namespace

Listener::Listener(UniqueFd listening, ListenerOptions options)
    : options_(std::move(options)), listening_(std::move(listening)), nextToken_(kFirstConnectionToken) {}

Listener::~Listener() {
  if (signals_) UnwatchTerminationSignal(signals_.get());
  for (auto& [token, connection] : connections_) connection->detach();
  for (auto& connection : retired_) connection->detach();
}

Result<std::unique_ptr<Listener>> Listener::CreateAtPath(const std::string& path, ListenerOptions options) {
  struct sockaddr_un address = {};
  address.sun_family = AF_UNIX;
  if (path.empty() || path.size() >= sizeof address.sun_path) {
    return Error(ENAMETOOLONG, Format("socket path of %zu bytes does not fit", path.size()));
  }
  std::memcpy(address.sun_path, path.data(), path.size());
  if (Status removed = RemoveStaleSocket(path, address); !removed) return removed.error();

  UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0));
  if (!fd) return Error::FromErrno("socket");
  if (::bind(fd.get(), reinterpret_cast<const struct sockaddr*>(&address), sizeof address) != 0) {
    return Error::FromErrno("bind " + path);
  }
  if (::fchmodat(AT_FDCWD, path.c_str(), 0666, 0) != 0) return Error::FromErrno("chmod " + path);
  if (::listen(fd.get(), SOMAXCONN) != 0) return Error::FromErrno("listen " + path);

  std::unique_ptr<Listener> listener(new Listener(std::move(fd), std::move(options)));
  if (Status ready = listener->setUp(); !ready) return ready.error();
  return listener;
}

Result<std::unique_ptr<Listener>> Listener::CreateFromSystemd(ListenerOptions options) {
  if (!SystemdPassedSocket()) return Error(ENOENT, "systemd passed no socket to this process");
  int fd = kSystemdFirstFd;
  Result<int> type = SocketOption(fd, SO_TYPE, "SO_TYPE");
  if (!type) return type.error();
  Result<int> domain = SocketOption(fd, SO_DOMAIN, "SO_DOMAIN");
  if (!domain) return domain.error();
  Result<int> listening = SocketOption(fd, SO_ACCEPTCONN, "SO_ACCEPTCONN");
  if (!listening) return listening.error();
  if (*type != SOCK_STREAM || *domain != AF_UNIX || *listening == 0) {
    return Error::Invalid("the socket systemd passed is not a listening Unix stream socket");
  }
  int flags = ::fcntl(fd, F_GETFL);
  if (flags < 0 || ::fcntl(fd, F_SETFL, flags | O_NONBLOCK) != 0 || ::fcntl(fd, F_SETFD, FD_CLOEXEC) != 0) {
    return Error::FromErrno("fcntl");
  }
  ::unsetenv("LISTEN_PID");
  ::unsetenv("LISTEN_FDS");
  ::unsetenv("LISTEN_FDNAMES");

  std::unique_ptr<Listener> listener(new Listener(UniqueFd(fd), std::move(options)));
  if (Status ready = listener->setUp(); !ready) return ready.error();
  return listener;
}

bool Listener::AnotherServerListens(const std::string& path) {
  struct sockaddr_un address = {};
  address.sun_family = AF_UNIX;
  if (SystemdPassedSocket() || path.empty() || path.size() >= sizeof address.sun_path) return false;
  std::memcpy(address.sun_path, path.data(), path.size());
  Status probed = ProbeServer(address);
  return !probed && probed.error().code() == EADDRINUSE;
}

Result<std::unique_ptr<Listener>> Listener::Create(const std::string& path, ListenerOptions options) {
  if (SystemdPassedSocket()) return CreateFromSystemd(std::move(options));
  return CreateAtPath(path, std::move(options));
}

Status Listener::setUp() {
  ::signal(SIGPIPE, SIG_IGN);
  sigset_t termination;
  sigemptyset(&termination);
  sigaddset(&termination, SIGTERM);
  if (int error = ::pthread_sigmask(SIG_BLOCK, &termination, nullptr); error != 0) {
    return Error(error, "pthread_sigmask");
  }
  RaiseOpenFileLimit(kFdsPerConnection * options_.maxConnections + 64);

  proc_ = options_.procDirectory;
  if (!proc_) {
    Result<UniqueFd> proc = OpenProcDirectory();
    if (!proc) return proc.error();
    proc_ = std::make_shared<const UniqueFd>(std::move(*proc));
  }
  epoll_.reset(::epoll_create1(EPOLL_CLOEXEC));
  if (!epoll_) return Error::FromErrno("epoll_create1");
  signals_.reset(::signalfd(-1, &termination, SFD_NONBLOCK | SFD_CLOEXEC));
  if (!signals_) return Error::FromErrno("signalfd");
  acceptTimer_.reset(::timerfd_create(CLOCK_MONOTONIC, TFD_NONBLOCK | TFD_CLOEXEC));
  if (!acceptTimer_) return Error::FromErrno("timerfd_create");
  wakeup_.reset(::eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC));
  if (!wakeup_) return Error::FromErrno("eventfd");
  housekeepingTimer_.reset(::timerfd_create(CLOCK_MONOTONIC, TFD_NONBLOCK | TFD_CLOEXEC));
  if (!housekeepingTimer_) return Error::FromErrno("timerfd_create");
  // Long work polls the same signalfd, so that SIGTERM ends it too.
  WatchTerminationSignal(signals_.get());

  for (auto [fd, token] : {std::pair{listening_.get(), kListeningToken}, std::pair{signals_.get(), kSignalToken},
                           std::pair{acceptTimer_.get(), kTimerToken}, std::pair{wakeup_.get(), kWakeupToken},
                           std::pair{housekeepingTimer_.get(), kHousekeepingToken}}) {
    if (Status added = EpollControl(epoll_.get(), EPOLL_CTL_ADD, fd, EPOLLIN, token); !added) return added;
  }
  return Status::Ok();
}

void Listener::setEventHandler(EventHandler handler) { handler_ = std::move(handler); }

void Listener::run() {
  running_ = true;
  deliverPendingEvents();
  struct epoll_event events[kMaxEventsPerWait];
  while (running_) {
    int n = ::epoll_wait(epoll_.get(), events, kMaxEventsPerWait, -1);
    if (n < 0) {
      if (errno == EINTR) continue;
      deliver(ListenerEvent{ListenerEvent::Kind::kError, nullptr, Error::FromErrno("epoll_wait").description()});
      return;
    }
    for (int i = 0; i < n && running_; ++i) {
      dispatch(events[i].data.u64, events[i].events);
      deliverPendingEvents();
      // A request that ran long may have read SIGTERM itself (and stopped
      // early for it): the loop learns of it here.
      if (TerminationRecorded() && !terminationDelivered_) {
        terminationDelivered_ = true;
        deliver(ListenerEvent{ListenerEvent::Kind::kTerminationImminent, nullptr, {}});
        deliverPendingEvents();
      }
    }
  }
}

void Listener::stop() {
  uint64_t one = 1;
  ssize_t written = ::write(wakeup_.get(), &one, sizeof one);
  (void)written;  // a full counter already means "stop"
}

void Listener::cancel() { stopListening(ListenerEvent::Kind::kConnectionInvalid, "cancelled"); }

void Listener::dispatch(uint64_t token, uint32_t events) {
  uint64_t count = 0;
  switch (token) {
    case kListeningToken:
      if (events & (EPOLLERR | EPOLLHUP)) {
        stopListening(ListenerEvent::Kind::kConnectionInvalid, "the listening socket was shut down");
      } else {
        acceptReady();
      }
      return;
    case kSignalToken:
      readSignal();
      return;
    case kTimerToken:
      if (::read(acceptTimer_.get(), &count, sizeof count) == sizeof count) resumeAccepting();
      return;
    case kWakeupToken:
      if (::read(wakeup_.get(), &count, sizeof count) == sizeof count) running_ = false;
      return;
    case kHousekeepingToken:
      if (::read(housekeepingTimer_.get(), &count, sizeof count) == sizeof count) housekeeping();
      return;
    default:
      break;
  }
  auto found = connections_.find(token);
  if (found == connections_.end()) return;  // closed earlier in this batch
  std::shared_ptr<Connection> connection = found->second;
  if (events & EPOLLOUT) connection->writeReady();
  if ((events & ~static_cast<uint32_t>(EPOLLOUT)) != 0 && connection->valid()) connection->readReady(scratch_);
  if (connection->sendDeadline()) armHousekeeping();
}

void Listener::acceptReady() {
  for (int i = 0; i < kMaxAcceptsPerWakeup && listening_; ++i) {
    if (!acceptOne()) return;
  }
}

bool Listener::acceptOne() {
  UniqueFd socket(::accept4(listening_.get(), nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC));
  if (!socket) {
    switch (errno) {
      case EAGAIN:
        return false;
      case ECONNABORTED:
      case EPROTO:
      case EINTR:
        return true;
      case EMFILE:
      case ENFILE:
      case ENOBUFS:
      case ENOMEM:
        pauseAccepting();
        return false;
      default:
        stopListening(ListenerEvent::Kind::kError, Error::FromErrno("accept").description());
        return false;
    }
  }
  // Over a cap, or without credentials: closed as it goes out of scope.
  // Peers without the trust are counted apart from trusted ones, and may
  // not take the last slots: however many connections they open (as root
  // too), the entitled client still gets in.
  if (connections_.size() >= options_.maxConnections) return true;
  Result<PeerIdentity> peer = PeerIdentity::Capture(socket.get(), proc_->get());
  if (!peer) return true;
  const bool trusted = !options_.trustPeer || options_.trustPeer(*peer);
  const size_t reserved = std::min(options_.maxConnectionsPerUid, options_.maxConnections / 2);
  if (!trusted && untrustedConnections_ >= options_.maxConnections - reserved) return true;
  size_t& ofUid = connectionsPerUid_[{peer->uid(), trusted}];
  if (ofUid >= options_.maxConnectionsPerUid) return true;
  int fd = socket.get();
  uint64_t token = nextToken_++;
  std::shared_ptr<Connection> connection(
      new Connection(this, token, std::move(socket), std::move(*peer), trusted, options_.sendTimeout));
  if (!EpollControl(epoll_.get(), EPOLL_CTL_ADD, fd, EPOLLIN | EPOLLRDHUP, token)) {
    connection->detach();
    return true;
  }
  ++ofUid;
  connections_.emplace(token, connection);
  if (!trusted) {
    ++untrustedConnections_;
    untrustedDeadlines_.emplace_back(std::chrono::steady_clock::now() + options_.untrustedLifetime, token);
    if (untrustedDeadlines_.size() == 1) armHousekeeping();
  }
  deliver(ListenerEvent{ListenerEvent::Kind::kConnection, connection, {}});
  return true;
}

void Listener::pauseAccepting() {
  if (!EpollControl(epoll_.get(), EPOLL_CTL_MOD, listening_.get(), 0, kListeningToken)) return;
  struct itimerspec pause = {};
  auto nanoseconds = std::chrono::duration_cast<std::chrono::nanoseconds>(options_.acceptRetryPause).count();
  pause.it_value.tv_sec = nanoseconds / 1'000'000'000;
  pause.it_value.tv_nsec = std::max<long>(nanoseconds % 1'000'000'000, pause.it_value.tv_sec ? 0 : 1);
  if (::timerfd_settime(acceptTimer_.get(), 0, &pause, nullptr) != 0) resumeAccepting();
}

void Listener::resumeAccepting() {
  if (listening_) (void)EpollControl(epoll_.get(), EPOLL_CTL_MOD, listening_.get(), EPOLLIN, kListeningToken);
}

void Listener::stopListening(ListenerEvent::Kind kind, std::string description) {
  if (!listening_) return;
  ::epoll_ctl(epoll_.get(), EPOLL_CTL_DEL, listening_.get(), nullptr);
  listening_.reset();
  pendingListenerEvents_.push_back(ListenerEvent{kind, nullptr, std::move(description)});
}

void Listener::readSignal() {
  struct signalfd_siginfo info;
  while (::read(signals_.get(), &info, sizeof info) == sizeof info) {
    if (info.ssi_signo == SIGTERM && !terminationDelivered_) {
      RequestTermination();
      terminationDelivered_ = true;
      deliver(ListenerEvent{ListenerEvent::Kind::kTerminationImminent, nullptr, {}});
    }
  }
}

void Listener::deliver(const ListenerEvent& event) {
  if (!handler_) return;
  EventHandler handler = handler_;  // the handler may replace itself
  handler(event);
}

void Listener::deliverPendingEvents() {
  while (!retired_.empty() || !pendingListenerEvents_.empty()) {
    if (!retired_.empty()) {
      std::shared_ptr<Connection> connection = std::move(retired_.front());
      retired_.pop_front();
      connection->deliverInvalid();
    } else {
      ListenerEvent event = std::move(pendingListenerEvents_.front());
      pendingListenerEvents_.pop_front();
      deliver(event);
    }
  }
}

void Listener::retire(const std::shared_ptr<Connection>& connection) {
  ::epoll_ctl(epoll_.get(), EPOLL_CTL_DEL, connection->socket_.get(), nullptr);
  if (connections_.erase(connection->token_) > 0) {
    auto count = connectionsPerUid_.find({connection->peer().uid(), connection->trusted()});
    if (count != connectionsPerUid_.end() && --count->second == 0) connectionsPerUid_.erase(count);
    if (!connection->trusted()) --untrustedConnections_;
  }
  retired_.push_back(connection);
}

void Listener::wantWrite(const Connection& connection, bool want) {
  const uint32_t events = EPOLLIN | EPOLLRDHUP | (want ? static_cast<uint32_t>(EPOLLOUT) : 0u);
  (void)EpollControl(epoll_.get(), EPOLL_CTL_MOD, connection.socket_.get(), events, connection.token_);
  if (want) armHousekeeping();
}

void Listener::housekeeping() {
  const auto now = std::chrono::steady_clock::now();
  while (!untrustedDeadlines_.empty() && untrustedDeadlines_.front().first <= now) {
    const uint64_t token = untrustedDeadlines_.front().second;
    untrustedDeadlines_.pop_front();
    if (auto found = connections_.find(token); found != connections_.end()) {
      found->second->close("closed: a peer without the entitlement may stay only a short while");
    }
  }

  std::vector<std::shared_ptr<Connection>> stalled;
  for (const auto& [token, connection] : connections_) {
    if (std::optional<std::chrono::steady_clock::time_point> due = connection->sendDeadline(); due && *due <= now) {
      stalled.push_back(connection);
    }
  }
  for (const std::shared_ptr<Connection>& connection : stalled) connection->flushOrDropStalled();
  armHousekeeping();
}

void Listener::armHousekeeping() {
  std::optional<std::chrono::steady_clock::time_point> next;
  if (!untrustedDeadlines_.empty()) next = untrustedDeadlines_.front().first;
  for (const auto& [token, connection] : connections_) {
    if (std::optional<std::chrono::steady_clock::time_point> due = connection->sendDeadline(); due) {
      next = next ? std::min(*next, *due) : *due;
    }
  }
  struct itimerspec due = {};
  if (next) {
    const auto wait = std::max<std::chrono::nanoseconds>(*next - std::chrono::steady_clock::now(),
                                                         std::chrono::milliseconds(1));
    due.it_value.tv_sec = static_cast<time_t>(wait.count() / 1'000'000'000);
    due.it_value.tv_nsec = static_cast<long>(wait.count() % 1'000'000'000);
  }
  ::timerfd_settime(housekeepingTimer_.get(), 0, &due, nullptr);
}

void Listener::bufferedChanged(size_t before, size_t after) {
  bufferedBytes_ = bufferedBytes_ - before + after;
  if (after <= before) return;
  while (bufferedBytes_ > options_.partialFrameBudget) {
    Connection* largest = nullptr;
    for (const auto& [token, connection] : connections_) {
      if (!largest || connection->bufferedBytes() > largest->bufferedBytes()) largest = connection.get();
    }
    if (largest == nullptr || largest->bufferedBytes() == 0) return;
    largest->close("dropped: partial frames exceed the listener's memory budget");
  }
}

}  // namespace vtr
