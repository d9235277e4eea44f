// The listener end to end over real sockets: misbehaving clients lose their
// own connection and nothing else, and the loop keeps serving the others.
#include <sys/socket.h>
#include <sys/stat.h>

#include <algorithm>
#include <atomic>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "tests/xpc/test_server.h"

namespace vtr::testing {
namespace {

XpcBytes Header(uint32_t n) { return {uint8_t(n), uint8_t(n >> 8), uint8_t(n >> 16), uint8_t(n >> 24)}; }

XpcBytes Concat(std::initializer_list<XpcBytes> parts) {
  XpcBytes all;
  for (const XpcBytes& part : parts) all.insert(all.end(), part.begin(), part.end());
  return all;
}

XpcBytes Frame(const XpcBytes& body) { return Concat({Header(static_cast<uint32_t>(body.size())), body}); }

// {"k": <value bytes>}
XpcBytes DictWith(const XpcBytes& value) { return Concat({{0x0A, 1, 0, 0, 0, 1, 0, 0, 0, 'k'}, value}); }

// How many bytes of 32 KiB writes a local stream socket holds before a
// non-blocking send would wait: it depends on the machine's socket buffer
// settings, so a test that must fill one measures it.
constexpr size_t kFloodCeiling = size_t{64} << 20;
size_t StreamSocketCapacity(size_t chunk) {
  int pair[2];
  if (::socketpair(AF_UNIX, SOCK_STREAM, 0, pair) != 0) return 0;
  UniqueFd writer(pair[0]), reader(pair[1]);
  std::vector<char> bytes(chunk);
  size_t held = 0;
  for (ssize_t n; held < kFloodCeiling && (n = ::send(writer.get(), bytes.data(), bytes.size(), MSG_DONTWAIT)) > 0;) {
    held += size_t(n);
  }
  return held;
}

bool AnyReasonContains(const TestServer& server, const std::string& text) {
  return std::any_of(server.invalidReasons.begin(), server.invalidReasons.end(),
                     [&](const std::string& reason) { return reason.find(text) != std::string::npos; });
}

TEST(ListenerTest, HostileFramesCloseOnlyTheirConnection) {
  XpcBytes nested;
  for (int i = 0; i <= kMaxMessageDepth; ++i) nested = Concat({nested, {0x09, 1, 0, 0, 0}});
  nested.push_back(0);
  struct Case {
    const char* name;
    XpcBytes bytes;
    const char* reason;
  };
  const Case cases[] = {
      {"length 0", Header(0), "frame length 0"},
      {"length over 16 MiB", Header(kMaxFrameBodyBytes + 1), "exceeds the limit"},
      {"unknown tag", Frame(DictWith({0x42})), "unknown tag 0x42"},
      {"bool byte 7", Frame(DictWith({0x01, 7})), "bool byte 0x07"},
      {"truncated payload", Frame(DictWith({0x02, 1, 2, 3})), "truncated payload"},
      {"bytes left over", Frame(Concat({DictWith({0x00}), {0x00}})), "left over"},
      {"NUL in string", Frame(DictWith({0x07, 2, 0, 0, 0, 'a', 0})), "NUL byte in a string"},
      {"duplicate key", Frame({0x0A, 2, 0, 0, 0, 1, 0, 0, 0, 'k', 0, 1, 0, 0, 0, 'k', 0}), "duplicate key"},
      {"nesting 65", Frame(Concat({{0x0A, 1, 0, 0, 0, 1, 0, 0, 0, 'k'}, nested})), "nesting deeper than 64"},
      {"top level array", Frame({0x09, 0, 0, 0, 0}), "not a dictionary"},
      {"huge count", Frame({0x0A, 0xFF, 0xFF, 0xFF, 0xFF}), "larger than the bytes left"},
  };
  TestServer server;
  // One well-behaved client stays connected through all of it.
  Result<XpcClient> steady = XpcClient::Connect(server.path());
  ASSERT_TRUE(steady.ok());
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    UniqueFd hostile = ConnectRaw(server.path());
    SendRaw(hostile.get(), c.bytes);
    EXPECT_TRUE(ClosedByPeer(hostile.get()));
    EXPECT_TRUE(server.waitUntil([&](TestServer& s) { return AnyReasonContains(s, c.reason); }));
    ExpectServed(server.path());
    ASSERT_TRUE(steady->send(Ping()).ok());
    Result<XpcObject> reply = steady->receive(kPatience);
    ASSERT_TRUE(reply.ok()) << reply.error().description();
  }
}

TEST(ListenerTest, StalledHalfFrameDelaysNobodyAndIsKept) {
  TestServer server;
  XpcBytes frame = *EncodeFrame(Ping("slow"));
  UniqueFd stalled = ConnectRaw(server.path());
  SendRaw(stalled.get(), std::span(frame).first(frame.size() / 2));
  ExpectServed(server.path());
  ExpectServed(server.path());
  // The stalled client's half frame was kept: the rest completes it.
  SendRaw(stalled.get(), std::span(frame).subspan(frame.size() / 2));
  XpcClient late{std::move(stalled)};
  Result<XpcObject> reply = late.receive(kPatience);
  ASSERT_TRUE(reply.ok()) << reply.error().description();
  EXPECT_EQ(*reply, Reply());
}

TEST(ListenerTest, HundredsOfIdleConnectionsDoNotStopService) {
  ListenerOptions options;
  options.maxConnectionsPerUid = 1000;  // the test's connections all share its uid
  TestServer server(options);
  std::vector<UniqueFd> idle;
  for (int i = 0; i < 300; ++i) idle.push_back(ConnectRaw(server.path()));
  // Some of them have sent a header and nothing else.
  for (int i = 0; i < 300; i += 3) SendRaw(idle[i].get(), Header(1000));
  ExpectServed(server.path());
  EXPECT_TRUE(server.waitUntil([](TestServer& s) { return s.connections == 301; }));
  idle.clear();
  EXPECT_TRUE(server.waitUntil([](TestServer& s) { return s.invalidReasons.size() == 301; }));
  EXPECT_TRUE(AnyReasonContains(server, "in the middle of a frame"));
}

TEST(ListenerTest, EveryEndIsReportedOnceWithItsReason) {
  TestServer server(ListenerOptions{}, [](TestServer&, const std::shared_ptr<Connection>& connection,
                                          const XpcObject& message) {
    if (message.find("cancel")) {
      connection->cancel();
      connection->cancel();
      EXPECT_FALSE(connection->send(Reply()).ok());
      return;
    }
    // Several frames in one write are answered in order.
    EXPECT_TRUE(connection->send(message).ok());
  });
  {
    UniqueFd quiet = ConnectRaw(server.path());
  }
  EXPECT_TRUE(server.waitUntil([](TestServer& s) { return s.invalidReasons.size() == 1; }));
  EXPECT_EQ(server.invalidReasons[0], "closed by the peer");

  Result<XpcClient> client = XpcClient::Connect(server.path());
  ASSERT_TRUE(client.ok());
  XpcBytes batch = Concat({*EncodeFrame(Ping("a")), *EncodeFrame(Ping("b")), *EncodeFrame(Ping("cancel")),
                           *EncodeFrame(Ping("never"))});
  SendRaw(client->fd(), batch);
  EXPECT_EQ(*client->receive(kPatience), Ping("a"));
  EXPECT_EQ(*client->receive(kPatience), Ping("b"));
  Result<XpcObject> end = client->receive(kPatience);
  ASSERT_FALSE(end.ok());
  EXPECT_EQ(end.error().code(), ECONNRESET);
  EXPECT_TRUE(server.waitUntil([](TestServer& s) { return s.invalidReasons.size() == 2; }));
  EXPECT_EQ(server.invalidReasons[1], "cancelled");
  EXPECT_EQ(server.messages, 3u);  // "never" came after the cancel
}

TEST(ListenerTest, ConnectionsBeyondTheCapAreClosedAtOnce) {
  ListenerOptions options;
  options.maxConnections = 2;
  TestServer server(options);
  Result<XpcClient> first = XpcClient::Connect(server.path());
  Result<XpcClient> second = XpcClient::Connect(server.path());
  ASSERT_TRUE(first.ok() && second.ok());
  ASSERT_TRUE(server.waitUntil([](TestServer& s) { return s.connections == 2; }));
  UniqueFd third = ConnectRaw(server.path());
  EXPECT_TRUE(ClosedByPeer(third.get()));
  *first = XpcClient(UniqueFd());
  ASSERT_TRUE(server.waitUntil([](TestServer& s) { return s.invalidReasons.size() == 1; }));
  ExpectServed(server.path());
}

TEST(ListenerTest, PartialFramesOverTheBudgetDropTheLargest) {
  ListenerOptions options;
  options.partialFrameBudget = 1 << 20;
  TestServer server(options);
  UniqueFd hog = ConnectRaw(server.path());
  // A well-formed start: {"k": <data of the rest>}, whose data never ends.
  const uint32_t length = 8 << 20;
  const uint32_t dataLength = length - 15;
  SendRaw(hog.get(), Concat({Header(length),
                             {0x0A, 1, 0, 0, 0, 1, 0, 0, 0, 'k', 0x06, static_cast<uint8_t>(dataLength),
                              static_cast<uint8_t>(dataLength >> 8), static_cast<uint8_t>(dataLength >> 16),
                              static_cast<uint8_t>(dataLength >> 24)},
                             XpcBytes(1000 << 10, 0)}));
  ASSERT_TRUE(server.waitUntil([](TestServer& s) { return s.connections == 1; }));

  // A request of 300 KiB pushes the total over the budget: the hog goes,
  // the request is served.
  Result<XpcClient> client = XpcClient::Connect(server.path());
  ASSERT_TRUE(client.ok());
  ASSERT_TRUE(client->send(XpcObject::Dictionary({{"Data", XpcObject::Data(XpcBytes(300 << 10, 7))}})).ok());
  Result<XpcObject> reply = client->receive(kPatience);
  ASSERT_TRUE(reply.ok()) << reply.error().description();
  EXPECT_TRUE(ClosedByPeer(hog.get()));
  EXPECT_TRUE(server.waitUntil([](TestServer& s) { return AnyReasonContains(s, "memory budget"); }));
}

TEST(ListenerTest, AClientThatStopsReadingIsDropped) {
  ListenerOptions options;
  options.sendTimeout = std::chrono::milliseconds(200);
  Status lastSend;
  TestServer server(options, [&](TestServer&, const std::shared_ptr<Connection>& connection, const XpcObject& message) {
    if (!message.find("flood")) {
      (void)connection->send(Reply());
      return;
    }
    XpcObject big = XpcObject::Dictionary({{"Data", XpcObject::Data(XpcBytes(1 << 20))}});
    for (int i = 0; i < 256 && connection->valid(); ++i) lastSend = connection->send(big);
  });
  Result<XpcClient> reader = XpcClient::Connect(server.path());
  ASSERT_TRUE(reader.ok());
  ASSERT_TRUE(reader->send(Ping("flood")).ok());  // and never reads
  ASSERT_TRUE(server.waitUntil([](TestServer& s) { return s.invalidReasons.size() == 1; }));
  EXPECT_NE(server.invalidReasons[0].find("stopped reading"), std::string::npos) << server.invalidReasons[0];
  EXPECT_FALSE(lastSend.ok());
  EXPECT_EQ(lastSend.error().code(), ETIMEDOUT);
  ExpectServed(server.path());
}

TEST(ListenerTest, ClientsThatStopReadingDelayNobodyAndAreDroppedOnTime) {
  ListenerOptions options;
  options.sendTimeout = std::chrono::milliseconds(2000);
  constexpr size_t kPart = 32 << 10;
  const size_t capacity = StreamSocketCapacity(kPart);
  if (capacity >= kFloodCeiling) GTEST_SKIP() << "a local socket here holds more than 64 MiB unread";
  const size_t parts = (capacity + Connection::kMaxQueuedBytes / 2) / kPart;
  TestServer server(options, [&](TestServer&, const std::shared_ptr<Connection>& connection, const XpcObject& message) {
    if (!message.find("flood")) {
      (void)connection->send(Reply());
      return;
    }
    // More than the socket holds, less than the queue's limit.
    XpcObject part = XpcObject::Dictionary({{"Data", XpcObject::Data(XpcBytes(kPart))}});
    for (size_t i = 0; i < parts; ++i) EXPECT_TRUE(connection->send(part).ok());
  });
  std::vector<XpcClient> stalled;
  for (int i = 0; i < 10; ++i) {
    Result<XpcClient> client = XpcClient::Connect(server.path());
    ASSERT_TRUE(client.ok());
    ASSERT_TRUE(client->send(Ping("flood")).ok());  // and never reads
    stalled.push_back(std::move(*client));
  }
  ASSERT_TRUE(server.waitUntil([](TestServer& s) { return s.messages == 10; }));
  const auto asked = std::chrono::steady_clock::now();
  ExpectServed(server.path());
  EXPECT_LT(std::chrono::steady_clock::now() - asked, std::chrono::milliseconds(1000));
  // Each is dropped once its output has not moved for the send timeout
  // (the served client's own end is among the reasons too, at any moment).
  const auto dropped = [](const TestServer& s) {
    return std::count_if(s.invalidReasons.begin(), s.invalidReasons.end(),
                         [](const std::string& reason) { return reason.find("stopped reading") != std::string::npos; });
  };
  ASSERT_TRUE(server.waitUntil([&](TestServer& s) { return dropped(s) >= 10; }));
  EXPECT_GE(std::chrono::steady_clock::now() - asked, std::chrono::milliseconds(1500));
  EXPECT_TRUE(server.waitUntil([&](TestServer& s) { return dropped(s) == 10; }));
}

TEST(ListenerTest, AQueueThatWaitedThroughALongCommandIsFlushedBeforeItIsJudged) {
  // A client reads its large reply normally while another's command holds
  // the loop past the send timeout; the timer that comes due meanwhile must
  // not take the queue's wait for the client's.
  ListenerOptions options;
  options.sendTimeout = std::chrono::milliseconds(300);
  constexpr size_t kPart = 32 << 10;
  const size_t capacity = StreamSocketCapacity(kPart);
  // Still queued after the socket was filled twice: what the timer sees.
  const size_t queued = Connection::kMaxQueuedBytes - 2 * kPart;
  if (2 * capacity >= capacity + queued) GTEST_SKIP() << "a local socket here holds too much unread";
  TestServer server(options, [&](TestServer&, const std::shared_ptr<Connection>& connection, const XpcObject& message) {
    if (message.find("flood")) {
      XpcObject part = XpcObject::Dictionary({{"Data", XpcObject::Data(XpcBytes(kPart))}});
      for (size_t i = 0; i < (capacity + queued) / kPart; ++i) EXPECT_TRUE(connection->send(part).ok());
    } else {
      std::this_thread::sleep_for(std::chrono::milliseconds(800));  // a long command
    }
    (void)connection->send(Reply());
  });
  Result<XpcClient> reader = XpcClient::Connect(server.path());
  ASSERT_TRUE(reader.ok());
  ASSERT_TRUE(reader->send(Ping("flood")).ok());
  ASSERT_TRUE(server.waitUntil([](TestServer& s) { return s.messages == 1; }));
  std::thread reading([&] {
    for (Result<XpcObject> message = reader->receive(kPatience); message.ok(); message = reader->receive(kPatience)) {
      if (*message == Reply()) return;
    }
    ADD_FAILURE() << "the reading client lost its connection";
  });
  // The second long command and the send deadline are both due when the
  // first ends.
  std::vector<XpcClient> busy;
  for (int i = 0; i < 2; ++i) {
    Result<XpcClient> client = XpcClient::Connect(server.path());
    ASSERT_TRUE(client.ok());
    busy.push_back(std::move(*client));
    ASSERT_TRUE(busy.back().send(Ping("long")).ok());
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
  }
  reading.join();
  EXPECT_TRUE(server.waitUntil([](TestServer& s) { return s.messages == 3; }));
  EXPECT_FALSE(AnyReasonContains(server, "stopped reading"));
}

TEST(ListenerTest, ConnectionsOfOneUserAreCappedAndUntrustedOnesExpire) {
  ListenerOptions options;
  options.maxConnectionsPerUid = 3;
  options.untrustedLifetime = std::chrono::milliseconds(300);
  options.maxConnections = 7;  // 4 for untrusted peers, 3 kept for trusted ones
  std::atomic<bool> trustNext{false};
  options.trustPeer = [&trustNext](const PeerIdentity&) { return trustNext.load(); };
  TestServer server(options);
  std::vector<UniqueFd> held;
  for (int i = 0; i < 5; ++i) held.push_back(ConnectRaw(server.path()));
  // An untrusted peer's frames are dropped, never answered.
  SendRaw(held[0].get(), *EncodeFrame(Ping()));
  EXPECT_TRUE(ClosedByPeer(held[3].get()));
  EXPECT_TRUE(ClosedByPeer(held[4].get()));
  EXPECT_TRUE(server.waitUntil([](TestServer& s) { return s.connections == 3 && s.messages == 1; }));
  const auto start = std::chrono::steady_clock::now();
  EXPECT_TRUE(ClosedByPeer(held[0].get())) << "an untrusted connection lives a short while only";
  EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(100));
  char byte;
  EXPECT_EQ(::recv(held[0].get(), &byte, 1, MSG_DONTWAIT), 0) << "and was sent nothing";

  // However many untrusted connections the same user holds, a trusted one
  // (the entitled client, also root here) still gets in.
  options.maxConnectionsPerUid = 8;
  options.untrustedLifetime = std::chrono::seconds(30);
  TestServer crowded(options);
  std::vector<UniqueFd> crowd;
  for (int i = 0; i < 8; ++i) crowd.push_back(ConnectRaw(crowded.path()));
  for (int i = 4; i < 8; ++i) EXPECT_TRUE(ClosedByPeer(crowd[i].get())) << i;
  EXPECT_TRUE(crowded.waitUntil([](TestServer& s) { return s.connections == 4; }));
  trustNext = true;
  ExpectServed(crowded.path());
}

TEST(ListenerTest, CancelledListenerReportsInvalidAndKeepsItsConnections) {
  TestServer server(ListenerOptions{}, [](TestServer& s, const std::shared_ptr<Connection>& connection,
                                          const XpcObject&) {
    s.listener().cancel();
    (void)connection->send(Reply());
  });
  Result<XpcClient> client = XpcClient::Connect(server.path());
  ASSERT_TRUE(client.ok());
  ASSERT_TRUE(client->send(Ping()).ok());
  ASSERT_TRUE(client->receive(kPatience).ok());
  ASSERT_TRUE(server.waitUntil([](TestServer& s) { return s.listenerEvents.size() == 1; }));
  EXPECT_EQ(server.listenerEvents[0].kind, ListenerEvent::Kind::kConnectionInvalid);
  EXPECT_FALSE(XpcClient::Connect(server.path()).ok());
  ASSERT_TRUE(client->send(Ping()).ok());
  EXPECT_TRUE(client->receive(kPatience).ok());
}

TEST(ListenerTest, CreateAtPathReplacesOnlyAStaleSocket) {
  TempDir dir;
  std::string path = dir / "s.sock";
  {
    Result<std::unique_ptr<Listener>> first = Listener::CreateAtPath(path);
    ASSERT_TRUE(first.ok()) << first.error().description();
    struct stat st;
    ASSERT_EQ(::stat(path.c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 07777, 0666u);
    Result<std::unique_ptr<Listener>> second = Listener::CreateAtPath(path);
    ASSERT_FALSE(second.ok());
    EXPECT_EQ(second.error().code(), EADDRINUSE);
  }
  // The first listener is gone; its socket file stayed behind.
  EXPECT_TRUE(Listener::CreateAtPath(path).ok());

  WriteFile(dir / "file", "not a socket");
  Result<std::unique_ptr<Listener>> onFile = Listener::CreateAtPath(dir / "file");
  ASSERT_FALSE(onFile.ok());
  EXPECT_EQ(onFile.error().code(), EEXIST);
  EXPECT_EQ(ReadFile(dir / "file"), "not a socket");
  EXPECT_FALSE(Listener::CreateAtPath(dir / std::string(120, 'x')).ok());
}

}  // namespace
}  // namespace vtr::testing
