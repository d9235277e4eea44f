// Listener: the helper's message service. It owns the listening Unix
// socket, every accepted connection and the event loop that serves them.
//
// The loop (epoll) runs on one thread and does everything there: it accepts,
// reads, decodes and delivers events by calling the handlers synchronously.
// While a handler runs the loop does nothing else, so the requests of all
// clients are served one at a time, and what a handler writes (progress, a
// reply) goes out before the next event is looked at.
//
// Reads never block: each connection assembles its frames as bytes arrive,
// so a client that sends half a frame and stalls, a slow client or hundreds
// of idle ones never delay another client's request. Nor do writes (see
// connection.h). Limits:
// - at most maxConnections connections, and maxConnectionsPerUid trusted and
//   as many untrusted ones for one user; untrusted ones never take the last
//   maxConnectionsPerUid slots (half the slots at most). Beyond that a new connection is accepted and
//   closed at once (so it does not sit in the backlog);
// - a peer that trustPeer does not trust has its frames validated and
//   dropped, never stored or decoded, and its connection closed
//   untrustedLifetime after accept;
// - the bytes held for frames in progress, over all connections, stay under
//   partialFrameBudget: past it the connection holding the largest partial
//   frame is dropped (a request of ordinary size then still gets through);
// - a client whose output makes no progress for sendTimeout is dropped; a
//   connection whose deadline passed is flushed first and dropped only if
//   that write still moves nothing (the loop may have been held by a long
//   command while the client kept reading).
//
// Listener events: a new connection; termination imminent (SIGTERM, read
// through a signalfd: since requests run inside handlers, a SIGTERM that
// arrives during one is seen after it returns); connection invalid (the
// listening socket was shut down, or cancel()); an error with a description
// (accept failed in a way that retrying cannot mend; the listener stops
// accepting). Accept failures from lack of resources (EMFILE, ENFILE,
// ENOBUFS, ENOMEM) pause accepting for acceptRetryPause; ECONNABORTED,
// EPROTO and EINTR (one connection's trouble) are retried at once. None of
// them is reported.
//
// Creating a listener ignores SIGPIPE for the process (writes use
// MSG_NOSIGNAL anyway), blocks SIGTERM in the calling thread, raises the
// soft limit of open files to what maxConnections needs when the hard limit
// allows, and opens /proc for the peers' identities unless given it. Create and run the
// listener on the same thread, before other threads start, so that SIGTERM
// reaches its signalfd. Only stop() may be called from another thread.
#ifndef VTR_XPC_LISTENER_H_
#define VTR_XPC_LISTENER_H_

#include <array>
#include <chrono>
#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <unordered_map>

#include "platform/result.h"
#include "platform/unique_fd.h"
#include "xpc/connection.h"

namespace vtr {

struct ListenerEvent {
  enum class Kind { kConnection, kTerminationImminent, kConnectionInvalid, kError };
  Kind kind;
  // kConnection: the new connection. Set its event handler before returning.
  std::shared_ptr<Connection> connection;
  // kError: what failed; kConnectionInvalid: why.
  std::string description;
};

struct ListenerOptions {
  size_t maxConnections = 1024;
  size_t maxConnectionsPerUid = 32;
  std::chrono::milliseconds sendTimeout{5000};
  // Whether a peer's frames are decoded, asked once at accept; null trusts
  // every peer.
  std::function<bool(const PeerIdentity&)> trustPeer;
  std::chrono::milliseconds untrustedLifetime{10000};
  size_t partialFrameBudget = size_t{64} << 20;
  std::chrono::milliseconds acceptRetryPause{100};
  // An open /proc directory through which the peers' processes are looked
  // up, shared with the listener. When null the listener opens "/proc" at
  // creation; a helper that confines itself to a root opens it before.
  std::shared_ptr<const UniqueFd> procDirectory;
};

class Listener {
 public:
  using EventHandler = std::function<void(const ListenerEvent&)>;

  // Listens at path: a stale socket left there is removed (a path that is
  // not a socket, or a socket someone still listens on, is an Error), the
  // new socket is made mode 0666 (the entitlement is the gate, not the
  // socket's mode). An Error when any step fails.
  static Result<std::unique_ptr<Listener>> CreateAtPath(const std::string& path, ListenerOptions options = {});

  // Listens on the socket systemd passed (fd 3, with LISTEN_FDS and
  // LISTEN_PID naming this process; the variables are then removed from the
  // environment). An Error when none was passed or fd 3 is not a listening
  // Unix stream socket.
  static Result<std::unique_ptr<Listener>> CreateFromSystemd(ListenerOptions options = {});

  // systemd's socket when one was passed to this process, else at path.
  static Result<std::unique_ptr<Listener>> Create(const std::string& path, ListenerOptions options = {});

  // Whether another server takes connections at path now, where Create
  // would then fail: false when systemd passed this process its socket.
  static bool AnotherServerListens(const std::string& path);

  // Closes every connection without events.
  ~Listener();
  Listener(const Listener&) = delete;
  Listener& operator=(const Listener&) = delete;

  void setEventHandler(EventHandler handler);

  // Serves until stop() is called; the helper never calls it, so for the
  // helper run() does not return (its handlers end the process).
  void run();

  // Makes run() return once the event in hand is handled. Callable from any
  // thread and from a signal handler.
  void stop();

  // Stops listening; the connection-invalid listener event follows once the
  // current handler has returned. Accepted connections stay.
  void cancel();


 private:
  friend class Connection;

  Listener(UniqueFd listening, ListenerOptions options);
  Status setUp();

  void dispatch(uint64_t token, uint32_t events);
  void acceptReady();
  // Accepts one pending connection; false when there is none or accepting
  // must wait.
  bool acceptOne();
  void pauseAccepting();
  void resumeAccepting();
  void stopListening(ListenerEvent::Kind kind, std::string description);
  void readSignal();
  // Closes what is past its time: untrusted connections, stalled senders;
  // then arms the timer for the next such moment.
  void housekeeping();
  void armHousekeeping();
  void deliver(const ListenerEvent& event);
  void deliverPendingEvents();

  // Called by connections.
  void retire(const std::shared_ptr<Connection>& connection);
  void bufferedChanged(size_t before, size_t after);
  void wantWrite(const Connection& connection, bool want);

  ListenerOptions options_;
  UniqueFd listening_;
  std::shared_ptr<const UniqueFd> proc_;
  UniqueFd epoll_;
  UniqueFd signals_;
  UniqueFd acceptTimer_;
  UniqueFd housekeepingTimer_;
  bool terminationDelivered_ = false;
  UniqueFd wakeup_;
  EventHandler handler_;
  bool running_ = false;
  uint64_t nextToken_;
  std::unordered_map<uint64_t, std::shared_ptr<Connection>> connections_;
  // Connections by uid and whether trusted.
  std::map<std::pair<uid_t, bool>, size_t> connectionsPerUid_;
  size_t untrustedConnections_ = 0;
  // Untrusted connections by the time they must be gone, oldest first (an
  // entry may outlive its connection).
  std::deque<std::pair<std::chrono::steady_clock::time_point, uint64_t>> untrustedDeadlines_;
  std::deque<std::shared_ptr<Connection>> retired_;
  std::deque<ListenerEvent> pendingListenerEvents_;
  size_t bufferedBytes_ = 0;
  std::array<uint8_t, 64 * 1024> scratch_;
};

}  // namespace vtr

#endif  // VTR_XPC_LISTENER_H_
