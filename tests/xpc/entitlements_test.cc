// Peer identity and entitlements: which executables may vouch for
// themselves, what their embedded section says, and that a peer that has
// gone or changed its executable gets no task at all. The clients are
// copies of small test programs built with entitlements embedded.
#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "tests/xpc/test_server.h"
#include "xpc/elf_section.h"
#include "xpc/sec_task.h"

extern char** environ;

namespace vtr::testing {
namespace {

constexpr char kEntitlement[] = "com.orvane.private.vitrell.vitrelld";

std::string BuiltClient(const std::string& name) { return std::string(VTR_XPC_CLIENT_DIR) + "/" + name; }

// A copy of a built client in dir with the given mode and owner.
std::string InstallClient(const TempDir& dir, const std::string& name, mode_t mode, uid_t owner) {
  std::string path = dir / (name + "-" + std::to_string(mode) + "-" + std::to_string(owner));
  std::filesystem::copy_file(BuiltClient(name), path, std::filesystem::copy_options::overwrite_existing);
  EXPECT_EQ(::chown(path.c_str(), owner, owner), 0);
  EXPECT_EQ(::chmod(path.c_str(), mode), 0);
  return path;
}

pid_t Spawn(const std::vector<std::string>& args) {
  std::vector<char*> argv;
  for (const std::string& arg : args) argv.push_back(const_cast<char*>(arg.c_str()));
  argv.push_back(nullptr);
  pid_t pid = -1;
  EXPECT_EQ(::posix_spawn(&pid, argv[0], nullptr, nullptr, argv.data(), environ), 0) << argv[0];
  return pid;
}

int ExitStatus(pid_t pid) {
  int status = 0;
  if (::waitpid(pid, &status, 0) != pid) return -1;
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

// What the server learned about the peer of the last message.
struct Outcome {
  bool created = false;
  int errorCode = 0;
  Value entitlement;
};

// A server that greets every client and, for each message, creates the
// peer's task and reads the entitlement. beforeCheck runs first.
class EntitlementServer {
 public:
  explicit EntitlementServer(std::function<void(const std::shared_ptr<Connection>&)> beforeCheck = nullptr)
      : server_(ListenerOptions{},
                [this, beforeCheck](TestServer&, const std::shared_ptr<Connection>& connection, const XpcObject&) {
                  if (beforeCheck) beforeCheck(connection);
                  Result<SecTask> task = SecTask::CreateWithPeer(connection->peer());
                  std::lock_guard lock(mutex_);
                  outcome_ = Outcome{task.ok(), task.ok() ? 0 : task.error().code(),
                                     task.ok() ? task->copyValueForEntitlement(kEntitlement) : Value()};
                  (void)connection->send(Reply());
                },
                /*greet=*/true) {}

  const std::string& path() const { return server_.path(); }
  bool waitForMessages(size_t n) {
    return server_.waitUntil([n](TestServer& s) { return s.messages >= n; });
  }
  std::optional<Outcome> outcome() {
    std::lock_guard lock(mutex_);
    return outcome_;
  }

 private:
  std::mutex mutex_;
  std::optional<Outcome> outcome_;
  TestServer server_;
};

TEST(ElfSectionTest, ReadsTheEmbeddedPropertyList) {
  UniqueFd entitled(::open(BuiltClient("xpc_client_entitled").c_str(), O_RDONLY | O_CLOEXEC));
  ASSERT_TRUE(entitled.valid());
  auto section = ReadElfSection(entitled.get(), kEntitlementsSectionName, kMaxEntitlementsBytes);
  ASSERT_TRUE(section.ok()) << section.error().description();
  ASSERT_TRUE(section->has_value());
  std::string text((*section)->begin(), (*section)->end());
  while (!text.empty() && text.back() == '\0') text.pop_back();
  EXPECT_EQ(text, ReadFile(VTR_XPC_ENTITLED_PLIST));

  auto small = ReadElfSection(entitled.get(), kEntitlementsSectionName, 16);
  EXPECT_FALSE(small.ok());

  UniqueFd plain(::open(BuiltClient("xpc_client_plain").c_str(), O_RDONLY | O_CLOEXEC));
  auto none = ReadElfSection(plain.get(), kEntitlementsSectionName, kMaxEntitlementsBytes);
  ASSERT_TRUE(none.ok()) << none.error().description();
  EXPECT_FALSE(none->has_value());
}

TEST(ElfSectionTest, MalformedFilesGiveErrorsNotCrashes) {
  TempDir dir;
  std::string binary = ReadFile(BuiltClient("xpc_client_entitled"));
  ASSERT_GT(binary.size(), 4096u);
  std::vector<size_t> cuts = {0, 4, 16, 52, 64, 1000, binary.size() / 2, binary.size() - 64, binary.size() - 1};
  for (size_t cut : cuts) {
    WriteFile(dir / "cut", binary.substr(0, cut));
    UniqueFd fd(::open((dir / "cut").c_str(), O_RDONLY | O_CLOEXEC));
    auto section = ReadElfSection(fd.get(), kEntitlementsSectionName, kMaxEntitlementsBytes);
    EXPECT_FALSE(section.ok() && section->has_value()) << "cut at " << cut;
  }
  // Section header offset pointing far past the end of the file.
  std::string bad = binary;
  for (int i = 0; i < 8; ++i) bad[0x28 + i] = '\x7f';
  WriteFile(dir / "bad", bad);
  UniqueFd fd(::open((dir / "bad").c_str(), O_RDONLY | O_CLOEXEC));
  EXPECT_FALSE(ReadElfSection(fd.get(), kEntitlementsSectionName, kMaxEntitlementsBytes).ok());
}

TEST(EntitlementsTest, OnlyARootOwnedFileOthersCannotWriteIsTrusted) {
  struct Case {
    mode_t mode;
    uid_t uid;
    bool trusted;
  };
  const Case cases[] = {
      {S_IFREG | 0755, 0, true},     {S_IFREG | 0750, 0, true},     {S_IFREG | 04755, 0, true},
      {S_IFREG | 0775, 0, false},    {S_IFREG | 0757, 0, false},    {S_IFREG | 0755, 1000, false},
      {S_IFLNK | 0777, 0, false},    {S_IFDIR | 0755, 0, false},    {S_IFREG | 0722, 0, false},
  };
  for (const Case& c : cases) {
    struct stat st = {};
    st.st_mode = c.mode;
    st.st_uid = c.uid;
    EXPECT_EQ(CheckEntitlementsTrusted(st).ok(), c.trusted) << std::oct << c.mode << " uid " << std::dec << c.uid;
  }
}

TEST(EntitlementsTest, ReadsTheDictionaryOfATrustedExecutable) {
  if (!IsRoot()) GTEST_SKIP() << "needs root to make a root-owned copy of the client";
  TempDir dir;
  std::string client = InstallClient(dir, "xpc_client_entitled", 0755, 0);
  UniqueFd fd(::open(client.c_str(), O_RDONLY | O_CLOEXEC));
  Result<Value> entitlements = ReadEntitlements(fd.get());
  ASSERT_TRUE(entitlements.ok()) << entitlements.error().description();
  EXPECT_EQ(entitlements->get(kEntitlement), Value::Boolean(true));

  UniqueFd plain(::open(InstallClient(dir, "xpc_client_plain", 0755, 0).c_str(), O_RDONLY | O_CLOEXEC));
  Result<Value> none = ReadEntitlements(plain.get());
  ASSERT_TRUE(none.ok());
  EXPECT_TRUE(none->isNil());
}

TEST(EntitlementsTest, PeersGetTheEntitlementOfTheirOwnExecutable) {
  if (!IsRoot()) GTEST_SKIP() << "needs root to give the client copies a root or foreign owner";
  struct Case {
    const char* name;
    const char* client;
    mode_t mode;
    uid_t owner;
    Value expected;
  };
  const Case cases[] = {
      {"boolean true", "xpc_client_entitled", 0755, 0, Value::Boolean(true)},
      {"string value", "xpc_client_string", 0750, 0, Value::String("true")},
      {"no section", "xpc_client_plain", 0755, 0, Value()},
      {"world-writable copy", "xpc_client_entitled", 0757, 0, Value()},
      {"group-writable copy", "xpc_client_entitled", 0775, 0, Value()},
      {"owned by nobody", "xpc_client_entitled", 0755, 65534, Value()},
  };
  TempDir dir;
  EntitlementServer server;
  size_t served = 0;
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    std::string client = InstallClient(dir, c.client, c.mode, c.owner);
    EXPECT_EQ(ExitStatus(Spawn({client, server.path()})), 0);
    ASSERT_TRUE(server.waitForMessages(++served));
    std::optional<Outcome> outcome = server.outcome();
    ASSERT_TRUE(outcome && outcome->created);
    EXPECT_EQ(outcome->entitlement, c.expected) << outcome->entitlement.description();
  }
}

TEST(EntitlementsTest, UntrustedOwnerMeansNoEntitlementEvenWithoutRoot) {
  if (IsRoot()) GTEST_SKIP() << "covered with chosen owners by PeersGetTheEntitlementOfTheirOwnExecutable";
  TempDir dir;
  std::string client = InstallClient(dir, "xpc_client_entitled", 0755, ::geteuid());
  EntitlementServer server;
  EXPECT_EQ(ExitStatus(Spawn({client, server.path()})), 0);
  ASSERT_TRUE(server.waitForMessages(1));
  std::optional<Outcome> outcome = server.outcome();
  ASSERT_TRUE(outcome && outcome->created);
  EXPECT_TRUE(outcome->entitlement.isNil());
}

TEST(PeerIdentityTest, APeerThatExecsAnotherProgramGetsNoTask) {
  TempDir dir;
  EntitlementServer server;
  // Connects as the entitled client, then becomes the plain one.
  EXPECT_EQ(ExitStatus(Spawn({BuiltClient("xpc_client_entitled"), server.path(), "--exec",
                              BuiltClient("xpc_client_plain")})),
            0);
  ASSERT_TRUE(server.waitForMessages(1));
  std::optional<Outcome> outcome = server.outcome();
  ASSERT_TRUE(outcome);
  EXPECT_FALSE(outcome->created);
  EXPECT_EQ(outcome->errorCode, ESRCH);
}

TEST(PeerIdentityTest, APeerThatIsGoneGetsNoTask) {
  EntitlementServer server([](const std::shared_ptr<Connection>& connection) {
    // The client waits for a reply; end it here, before its task is made.
    ::kill(connection->peer().pid(), SIGKILL);
    ::waitpid(connection->peer().pid(), nullptr, 0);
  });
  Spawn({BuiltClient("xpc_client_plain"), server.path()});
  ASSERT_TRUE(server.waitForMessages(1));
  std::optional<Outcome> outcome = server.outcome();
  ASSERT_TRUE(outcome);
  EXPECT_FALSE(outcome->created);
  EXPECT_EQ(outcome->errorCode, ESRCH);
}

TEST(PeerIdentityTest, CapturesTheConnectingProcess) {
  EntitlementServer server;
  Result<XpcClient> client = XpcClient::Connect(server.path());
  ASSERT_TRUE(client.ok());
  ASSERT_TRUE(client->receive(kPatience).ok());  // greeting
  ASSERT_TRUE(client->send(Ping()).ok());
  ASSERT_TRUE(client->receive(kPatience).ok());
  std::optional<Outcome> outcome = server.outcome();
  // The test runner itself: alive, same executable, no entitlements section.
  ASSERT_TRUE(outcome && outcome->created);
  EXPECT_TRUE(outcome->entitlement.isNil());
}

TEST(PeerIdentityTest, StartTimeIsField22CountedFromTheLastParenthesis) {
  const std::string tail = " S 1 2 3 4 5 6 7 8 9 10 11 12 13 14 15 16 17 18 987654 20 21";
  EXPECT_EQ(*ParseProcessStartTime("42 (sh)" + tail), 987654u);
  EXPECT_EQ(*ParseProcessStartTime("42 (a) b (c) ) 0 0 0)" + tail), 987654u);
  EXPECT_FALSE(ParseProcessStartTime("42 (sh) S 1 2 3").ok());
  EXPECT_FALSE(ParseProcessStartTime("42 sh" + tail).ok());
  EXPECT_FALSE(ParseProcessStartTime("42 (sh) S 1 2 3 4 5 6 7 8 9 10 11 12 13 14 15 16 17 18 -5 20").ok());

  UniqueFd self(::open("/proc/self", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  Result<uint64_t> start = ReadProcessStartTime(self.get());
  ASSERT_TRUE(start.ok()) << start.error().description();
  EXPECT_GT(*start, 0u);
}

}  // namespace
}  // namespace vtr::testing
