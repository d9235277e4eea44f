// Listener behaviour that involves the whole process (SIGTERM, systemd's
// socket passing), run in forked children so the test runner itself is
// never signalled nor handed another socket.
#include <fcntl.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <functional>
#include <string>
#include <thread>

#include <gtest/gtest.h>

#include "tests/xpc/test_server.h"

namespace vtr::testing {
namespace {

// A child process with a pipe on which it reports progress, one letter per
// step. The body runs in the child only and never returns into the tests.
class Child {
 public:
  explicit Child(const std::function<int(int reportFd)>& body) {
    int fds[2];
    if (::pipe2(fds, O_CLOEXEC) != 0) {
      ADD_FAILURE() << "pipe2";
      return;
    }
    pid_ = ::fork();
    if (pid_ == 0) {
      ::close(fds[0]);
      ::_exit(body(fds[1]));
    }
    ::close(fds[1]);
    reports_.reset(fds[0]);
  }

  ~Child() {
    if (pid_ > 0 && !reaped_) {
      ::kill(pid_, SIGKILL);
      ::waitpid(pid_, nullptr, 0);
    }
  }

  pid_t pid() const { return pid_; }

  // The next letter the child reports; 0 when it closed the pipe or stayed
  // silent past kPatience.
  char next() {
    if (!WaitReadable(reports_.get(), kPatience)) return 0;
    char letter = 0;
    return ::read(reports_.get(), &letter, 1) == 1 ? letter : 0;
  }

  // The child's exit status; -1 when it did not exit normally.
  int wait() {
    int status = 0;
    if (::waitpid(pid_, &status, 0) != pid_) return -1;
    reaped_ = true;
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }

 private:
  pid_t pid_ = -1;
  bool reaped_ = false;
  UniqueFd reports_;
};

void Report(int fd, char letter) { (void)!::write(fd, &letter, 1); }

// Serves in the child: replies to each message after running onMessage,
// reports 'T' and exits 0 on termination imminent, 'I' and exits 0 when the
// listener becomes invalid.
int Serve(Listener& listener, int reportFd, const std::function<void(const XpcObject&)>& onMessage) {
  listener.setEventHandler([&](const ListenerEvent& event) {
    switch (event.kind) {
      case ListenerEvent::Kind::kConnection: {
        std::shared_ptr<Connection> connection = event.connection;
        connection->setEventHandler([&, connection](const ConnectionEvent& e) {
          if (e.kind != ConnectionEvent::Kind::kMessage) return;
          onMessage(e.message);
          if (connection->send(Reply())) Report(reportFd, 'D');
        });
        return;
      }
      case ListenerEvent::Kind::kTerminationImminent:
        Report(reportFd, 'T');
        ::_exit(0);
      case ListenerEvent::Kind::kConnectionInvalid:
        Report(reportFd, 'I');
        ::_exit(0);
      case ListenerEvent::Kind::kError:
        ::_exit(20);
    }
  });
  Report(reportFd, 'R');
  listener.run();
  return 21;
}

TEST(ListenerProcessTest, TerminationIsDeliveredAfterTheRunningRequest) {
  TempDir dir;
  std::string path = dir / "s.sock";
  Child child([&](int reportFd) {
    Result<std::unique_ptr<Listener>> listener = Listener::CreateAtPath(path);
    if (!listener) return 10;
    return Serve(**listener, reportFd, [&](const XpcObject&) {
      Report(reportFd, 'M');
      std::this_thread::sleep_for(std::chrono::milliseconds(300));
    });
  });
  ASSERT_EQ(child.next(), 'R');
  Result<XpcClient> client = XpcClient::Connect(path);
  ASSERT_TRUE(client.ok());
  ASSERT_TRUE(client->send(Ping()).ok());
  ASSERT_EQ(child.next(), 'M');
  ASSERT_EQ(::kill(child.pid(), SIGTERM), 0);
  // The request in hand finishes and is answered before the signal is seen.
  EXPECT_TRUE(client->receive(kPatience).ok());
  EXPECT_EQ(child.next(), 'D');
  EXPECT_EQ(child.next(), 'T');
  EXPECT_EQ(child.wait(), 0);
}

TEST(ListenerProcessTest, ServesTheSocketSystemdPasses) {
  TempDir dir;
  std::string path = dir / "s.sock";
  std::string unused = dir / "unused.sock";
  Child child([&](int reportFd) {
    UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM, 0));
    struct sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    std::memcpy(address.sun_path, path.data(), path.size());
    if (::bind(fd.get(), reinterpret_cast<struct sockaddr*>(&address), sizeof address) != 0) return 10;
    if (::listen(fd.get(), 8) != 0 || ::dup2(fd.get(), 3) != 3) return 11;
    ::setenv("LISTEN_FDS", "1", 1);
    ::setenv("LISTEN_PID", std::to_string(::getpid()).c_str(), 1);
    Result<std::unique_ptr<Listener>> listener = Listener::Create(unused);
    if (!listener) return 12;
    if (std::getenv("LISTEN_FDS") != nullptr || ::access(unused.c_str(), F_OK) == 0) return 13;
    return Serve(**listener, reportFd, [](const XpcObject& message) {
      if (message.find("shutdown")) ::shutdown(3, SHUT_RDWR);
    });
  });
  ASSERT_EQ(child.next(), 'R');
  ExpectServed(path);
  EXPECT_EQ(child.next(), 'D');
  Result<XpcClient> client = XpcClient::Connect(path);
  ASSERT_TRUE(client.ok());
  ASSERT_TRUE(client->send(Ping("shutdown")).ok());
  EXPECT_EQ(child.next(), 'D');
  // A listening socket shut down under the listener makes it invalid.
  EXPECT_EQ(child.next(), 'I');
  EXPECT_EQ(child.wait(), 0);
}

TEST(ListenerProcessTest, WithoutASystemdSocketCreateFromSystemdFails) {
  Child child([](int) {
    ::setenv("LISTEN_FDS", "1", 1);
    ::setenv("LISTEN_PID", "1", 1);  // meant for another process
    return Listener::CreateFromSystemd().ok() ? 1 : 0;
  });
  EXPECT_EQ(child.wait(), 0);
}

}  // namespace
}  // namespace vtr::testing
