// A listener serving on a background thread for the tests, recording what
// its handlers see, plus raw socket helpers for clients that misbehave.
#ifndef VTR_TESTS_XPC_TEST_SERVER_H_
#define VTR_TESTS_XPC_TEST_SERVER_H_

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <chrono>
#include <condition_variable>
#include <cstring>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "platform/unique_fd.h"
#include "tests/support/test_support.h"
#include "xpc/client.h"
#include "xpc/listener.h"
#include "xpc/socket_io.h"
#include "xpc/wire_codec.h"

namespace vtr::testing {

inline constexpr auto kPatience = std::chrono::seconds(10);

inline XpcObject Ping(const std::string& tag = "ping") { return XpcObject::Dictionary({{tag, XpcObject::Bool(true)}}); }
inline XpcObject Reply() { return XpcObject::Dictionary({{"Response", XpcObject::Bool(true)}}); }

class TestServer {
 public:
  // Runs on the loop thread for every message; the default replies Reply().
  using MessageHandler = std::function<void(TestServer&, const std::shared_ptr<Connection>&, const XpcObject&)>;

  explicit TestServer(ListenerOptions options = {}, MessageHandler onMessage = nullptr, bool greet = false)
      : onMessage_(std::move(onMessage)), greet_(greet) {
    Result<std::unique_ptr<Listener>> listener = Listener::CreateAtPath(path_, std::move(options));
    EXPECT_TRUE(listener.ok()) << listener.error().description();
    if (!listener) return;
    listener_ = std::move(*listener);
    listener_->setEventHandler([this](const ListenerEvent& event) { onListenerEvent(event); });
    thread_ = std::thread([this] { listener_->run(); });
  }

  ~TestServer() {
    if (listener_) listener_->stop();
    if (thread_.joinable()) thread_.join();
  }

  const std::string& path() const { return path_; }
  Listener& listener() { return *listener_; }

  // Waits (at most kPatience) until condition holds over the records.
  bool waitUntil(const std::function<bool(TestServer&)>& condition) {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, kPatience, [&] { return condition(*this); });
  }

  // Records; read them under waitUntil or after the server stopped.
  size_t connections = 0;
  size_t messages = 0;
  std::vector<std::string> invalidReasons;
  std::vector<ListenerEvent> listenerEvents;

 private:
  void onListenerEvent(const ListenerEvent& event) {
    if (event.kind == ListenerEvent::Kind::kConnection) {
      std::shared_ptr<Connection> connection = event.connection;
      connection->setEventHandler([this, connection](const ConnectionEvent& e) { onConnectionEvent(connection, e); });
      if (greet_) (void)connection->send(XpcObject::Dictionary({{"hello", XpcObject::Bool(true)}}));
      record([&] { ++connections; });
    } else {
      record([&] { listenerEvents.push_back(event); });
    }
  }

  void onConnectionEvent(const std::shared_ptr<Connection>& connection, const ConnectionEvent& event) {
    if (event.kind == ConnectionEvent::Kind::kInvalid) {
      record([&] { invalidReasons.push_back(event.reason); });
      return;
    }
    if (onMessage_) {
      onMessage_(*this, connection, event.message);
    } else {
      (void)connection->send(Reply());
    }
    record([&] { ++messages; });
  }

  void record(const std::function<void()>& change) {
    {
      std::lock_guard lock(mutex_);
      change();
    }
    changed_.notify_all();
  }

  TempDir dir_;
  std::string path_ = dir_ / "s.sock";
  MessageHandler onMessage_;
  bool greet_;
  std::unique_ptr<Listener> listener_;
  std::thread thread_;
  std::mutex mutex_;
  std::condition_variable changed_;
};

// A connected socket that the test drives byte by byte.
inline UniqueFd ConnectRaw(const std::string& path) {
  UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  struct sockaddr_un address = {};
  address.sun_family = AF_UNIX;
  std::memcpy(address.sun_path, path.data(), path.size());
  if (::connect(fd.get(), reinterpret_cast<const struct sockaddr*>(&address), sizeof address) != 0) {
    ADD_FAILURE() << "connect " << path << ": " << std::strerror(errno);
    return UniqueFd();
  }
  return fd;
}

inline void SendRaw(int fd, std::span<const uint8_t> bytes) {
  ASSERT_TRUE(SendAll(fd, bytes, std::chrono::seconds(5)).ok());
}

// True when the peer closes fd within kPatience (whatever it sent first is
// skipped).
inline bool ClosedByPeer(int fd) {
  char buffer[4096];
  auto deadline = std::chrono::steady_clock::now() + kPatience;
  while (std::chrono::steady_clock::now() < deadline) {
    if (!WaitReadable(fd, std::chrono::milliseconds(100))) continue;
    ssize_t n = ::recv(fd, buffer, sizeof buffer, MSG_DONTWAIT);
    if (n == 0 || (n < 0 && errno == ECONNRESET)) return true;
  }
  return false;
}

// A fresh client sends a ping and must get the reply.
inline void ExpectServed(const std::string& path) {
  Result<XpcClient> client = XpcClient::Connect(path);
  ASSERT_TRUE(client.ok()) << client.error().description();
  ASSERT_TRUE(client->send(Ping()).ok());
  Result<XpcObject> reply = client->receive(kPatience);
  ASSERT_TRUE(reply.ok()) << reply.error().description();
  EXPECT_EQ(*reply, Reply());
}

}  // namespace vtr::testing

#endif  // VTR_TESTS_XPC_TEST_SERVER_H_
