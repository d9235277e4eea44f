// End-to-end tests of the helper's service: a real vitd_helper in a sandbox
// root, driven over its socket.
#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <thread>

#include <gtest/gtest.h>

#include "tests/support/file_inspection.h"
#include "tests/support/test_support.h"
#include "tests/vitd_helper/helper_sandbox.h"
#include "xpc/client.h"
#include "xpc/wire_codec.h"

namespace vtr::testing {
namespace {

using namespace std::chrono_literals;

XpcObject Request(std::initializer_list<std::pair<std::string, XpcObject>> entries) {
  return XpcObject::Dictionary(entries);
}

XpcObject Response(bool value) { return XpcObject::Dictionary({{"Response", XpcObject::Bool(value)}}); }

class ServiceTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (!IsRoot()) GTEST_SKIP() << "the helper chroots into its sandbox root: needs root";
    ASSERT_TRUE(sandbox_.start()) << sandbox_.log();
  }

  // vitdctl (or a variant) against the sandboxed helper, waiting 1 s at most.
  HelperSandbox::RunResult vitdctl(const std::string& executable, std::vector<std::string> args) {
    args.insert(args.begin(), {"--root", sandbox_.root(), "--timeout", "1"});
    return sandbox_.run(executable, args);
  }

  HelperSandbox sandbox_;
};

TEST_F(ServiceTest, OnlyAnEntitledClientIsServed) {
  // vitdctl carries the entitlement with the value true.
  HelperSandbox::RunResult entitled = vitdctl(VitdctlExecutable(), {"prepareWorkContainer", "/private/var/W"});
  EXPECT_EQ(entitled.status, 0);
  EXPECT_EQ(entitled.output, "{\"Response\":true}\n");
  EXPECT_TRUE(IsDirectory(sandbox_.host("/private/var/W")));

  struct Case {
    std::string executable;
    std::string reason;
  };
  TempDir copies;
  // A copy that group and others may write, and one owned by someone else,
  // cannot vouch for their entitlements.
  const std::string writable = copies / "vitdctl-writable";
  const std::string foreign = copies / "vitdctl-foreign";
  for (const std::string& copy : {writable, foreign}) {
    ASSERT_EQ(std::system(("cp " + VitdctlExecutable() + " " + copy).c_str()), 0);
  }
  ASSERT_EQ(::chmod(writable.c_str(), 0777), 0);
  ASSERT_EQ(::chown(foreign.c_str(), kMobileUid, kMobileGid), 0);
  HelperSandbox::RunResult copy = vitdctl(writable, {"prepareWorkContainer", "/private/var/U"});
  EXPECT_NE(copy.errors.find("owned by root and not writable by group or others (it is owned by uid 0,\n  mode 777)"),
            std::string::npos)
      << copy.errors;
  const Case refused[] = {
      {UnentitledVitdctlExecutable(), "-[VTRHMessageResponder hasEntitlementVitrelld]: No data received."},
      {StringEntitledVitdctlExecutable(), "-[VTRHMessageResponder hasEntitlementVitrelld]: format not correct: true"},
      {writable, "-[VTRHMessageResponder hasEntitlementVitrelld]: No data received."},
      {foreign, "-[VTRHMessageResponder hasEntitlementVitrelld]: No data received."},
  };
  for (const Case& c : refused) {
    HelperSandbox::RunResult r = vitdctl(c.executable, {"prepareWorkContainer", "/private/var/U"});
    EXPECT_EQ(r.status, 75) << c.executable;  // no answer at all
    EXPECT_EQ(r.output, "") << c.executable;
    // vitdctl says what usually causes the silence.
    EXPECT_NE(r.errors.find("not entitled"), std::string::npos) << r.errors;
    EXPECT_FALSE(IsDirectory(sandbox_.host("/private/var/U"))) << c.executable;
    EXPECT_TRUE(sandbox_.logged(c.reason)) << c.executable << "\n" << sandbox_.log();
  }
  EXPECT_TRUE(sandbox_.logged("The client does not have proper entitlement"));
}

TEST_F(ServiceTest, APeerThatExecsAnotherProgramIsNoLongerEntitled) {
  // A child of this (entitled) test connects, is served once, then execs a
  // shell, which sends the request: same process, another executable.
  Result<XpcBytes> frame = EncodeFrame(Request({{"prepareWorkContainer:", XpcObject::String("/private/var/X")}}));
  ASSERT_TRUE(frame.ok());
  TempDir dir;
  WriteFile(dir / "frame", std::string(frame->begin(), frame->end()));
  const std::string script = "cat " + (dir / "frame") + " >&3; sleep 1";
  const std::string socketPath = sandbox_.socketPath();
  const pid_t child = ::fork();
  if (child == 0) {
    Result<XpcClient> client = XpcClient::Connect(socketPath);
    if (!client.ok()) ::_exit(1);
    // A first request, answered, proves that the helper has accepted the
    // connection and recorded who is behind it before the exec.
    if (!client->send(Request({{"removeWorkContainer:", XpcObject::String("/private/var/none")}})).ok() ||
        !client->receive(std::chrono::seconds(10)).ok()) {
      ::_exit(2);
    }
    // dup2 onto itself would keep close-on-exec; clear it either way.
    if (client->fd() != 3) ::dup2(client->fd(), 3);
    ::fcntl(3, F_SETFD, 0);
    ::execl("/bin/sh", "sh", "-c", script.c_str(), static_cast<char*>(nullptr));
    ::_exit(127);
  }
  int status = 0;
  ::waitpid(child, &status, 0);
  EXPECT_EQ(WEXITSTATUS(status), 0);
  EXPECT_FALSE(IsDirectory(sandbox_.host("/private/var/X")));
  EXPECT_TRUE(sandbox_.logged("-[VTRHMessageResponder hasEntitlementVitrelld]: Cannot create SecTask from audit token"))
      << sandbox_.log();
}

TEST_F(ServiceTest, KeysAreWalkedInOrderAndAnUnknownKeyEndsTheWalk) {
  // Two commands: two replies, in key order.
  std::vector<XpcObject> two = sandbox_.request(
      Request({{"removeWorkContainer:", XpcObject::String("/private/var/missing")},
               {"prepareLogContainer:", XpcObject::String("/tmp/not-logs")}}),
      2);
  EXPECT_EQ(two, (std::vector<XpcObject>{Response(false), Response(true)}));

  // "aaa:" sorts first and names no command: nothing at all is done.
  std::vector<XpcObject> none = sandbox_.request(
      Request({{"prepareWorkContainer:", XpcObject::String("/private/var/Y")}, {"aaa:", XpcObject::Bool(true)}}), 1,
      1000ms);
  EXPECT_TRUE(none.empty());
  EXPECT_FALSE(IsDirectory(sandbox_.host("/private/var/Y")));
  EXPECT_TRUE(sandbox_.logged("VTRHMessageResponder does not respond to aaa:."));

  // A method of the responder that is not a command is not reachable; the
  // command before it keeps its reply.
  std::vector<XpcObject> one = sandbox_.request(
      Request({{"prepareWorkContainer:", XpcObject::String("/private/var/Z")},
               {"sendPassResponse", XpcObject::Bool(true)}}),
      2, 1000ms);
  EXPECT_EQ(one, std::vector<XpcObject>{Response(true)});
  EXPECT_TRUE(sandbox_.logged("VTRHMessageResponder does not respond to sendPassResponse."));
}

TEST_F(ServiceTest, TheExampleClientAndVitdctlDriveTheHelperThroughTheClientLibrary) {
  const std::string example = std::string(VTR_BINARY_DIR) + "/bin/vitd-example";
  HelperSandbox::RunResult made =
      sandbox_.run(example, {"-s", sandbox_.socketPath(), "prepareWorkContainer", "\"/private/var/E\""});
  EXPECT_EQ(made.status, 0) << made.errors;
  EXPECT_EQ(made.output, "prepareWorkContainer: response true\n");
  EXPECT_TRUE(IsDirectory(sandbox_.host("/private/var/E")));
  HelperSandbox::RunResult refused =
      sandbox_.run(example, {"-s", sandbox_.socketPath(), "writeNvram", R"({"Name": "a/b", "Value": "x"})"});
  EXPECT_EQ(refused.status, 1);
  EXPECT_EQ(refused.output, "writeNvram: response false\n");

  // A request whose second key the helper does not know: one answer, then
  // vitdctl says why the second never comes.
  TempDir dir;
  WriteFile(dir / "request.json", R"({"prepareWorkContainer:": "/private/var/F", "zzz:": true})");
  HelperSandbox::RunResult partial =
      vitdctl(VitdctlExecutable(), {"--label", "send", "--raw", dir / "request.json"});
  EXPECT_EQ(partial.status, 75);
  EXPECT_EQ(partial.output, "prepareWorkContainer: {\"Response\":true}\n");
  EXPECT_NE(partial.errors.find("after 1 of 2 responses"), std::string::npos) << partial.errors;
  EXPECT_NE(partial.errors.find("a request key it does not know"), std::string::npos) << partial.errors;
}

TEST_F(ServiceTest, ASecondHelperOnTheSameRootNamesTheHelperInTheWay) {
  HelperSandbox::RunResult second = sandbox_.run(HelperExecutable(), {"--root", sandbox_.root(), "--stderr"});
  EXPECT_EQ(second.status, 1);
  EXPECT_NE(second.errors.find("Could not create XPC listener.\nCannot listen: another helper is already listening on "
                               "/run/com.orvane.vitrelldhelper.sock"),
            std::string::npos)
      << second.errors;
}

TEST_F(ServiceTest, ValuesOfOtherTypesAreLeftOut) {
  const std::pair<const char*, XpcObject> skipped[] = {
      {"uint64", XpcObject::Uint64(1)},
      {"double", XpcObject::Double(1.5)},
      {"data", XpcObject::Data({1, 2})},
      {"array", XpcObject::Array({XpcObject::String("/private/var/A")})},
      {"invalid UTF-8", XpcObject::String("/private/var/\xff")},
  };
  for (const auto& [kind, value] : skipped) {
    std::vector<XpcObject> replies =
        sandbox_.request(Request({{"prepareWorkContainer:", value}, {"removeWorkContainer:", XpcObject::String("/private/var/x")}}),
                         2, 300ms);
    // Only the entry that survived the conversion is answered.
    EXPECT_EQ(replies, std::vector<XpcObject>{Response(true)}) << kind;
  }
  EXPECT_FALSE(IsDirectory(sandbox_.host("/private/var/A")));
  EXPECT_TRUE(sandbox_.logged("The value for key prepareWorkContainer: has a type that is not supported yet"));
}

TEST_F(ServiceTest, HostileFramesAndStalledClientsDoNotStopTheService) {
  auto rawConnect = [&] {
    const int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    struct sockaddr_un addr = {};
    addr.sun_family = AF_UNIX;
    std::snprintf(addr.sun_path, sizeof addr.sun_path, "%s", sandbox_.socketPath().c_str());
    EXPECT_EQ(::connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0);
    return fd;
  };
  const std::string hostile[] = {
      std::string("\0\0\0\0", 4),                   // length 0
      std::string("\xff\xff\xff\x7f", 4),           // length far beyond the limit
      std::string("\x01\0\0\0\x0b", 5),             // unknown tag
      std::string("\x02\0\0\0\x01\x02", 6),         // bool byte not 0/1
      std::string("\x01\0\0\0\x00", 5),             // top level not a dictionary
      std::string("\x06\0\0\0\x0a\x01\0\0\0\x00", 10),  // dictionary cut short
  };
  std::vector<int> stalled;
  for (const std::string& bytes : hostile) {
    const int fd = rawConnect();
    ASSERT_EQ(::write(fd, bytes.data(), bytes.size()), static_cast<ssize_t>(bytes.size()));
    stalled.push_back(fd);
  }
  // Half a frame, then silence.
  const int half = rawConnect();
  ASSERT_EQ(::write(half, "\x40\0\0\0\x0a", 5), 5);
  stalled.push_back(half);

  const auto started = std::chrono::steady_clock::now();
  std::vector<XpcObject> replies =
      sandbox_.request(Request({{"prepareWorkContainer:", XpcObject::String("/private/var/OK")}}), 1);
  EXPECT_EQ(replies, std::vector<XpcObject>{Response(true)});
  EXPECT_LT(std::chrono::steady_clock::now() - started, 2s);
  for (int fd : stalled) ::close(fd);
  EXPECT_TRUE(sandbox_.running());
}

TEST_F(ServiceTest, DisconnectKeepsTheHelperAndSigtermEndsItWithStatusZero) {
  // start() itself connected once to see the helper ready.
  const auto disconnects = [this] {
    size_t count = 0;
    for (size_t at = 0; (at = sandbox_.log().find("XPC disconnected by client\n", at)) != std::string::npos; ++at) {
      ++count;
    }
    return count;
  };
  std::this_thread::sleep_for(100ms);
  const size_t before = disconnects();
  {
    Result<XpcClient> client = XpcClient::Connect(sandbox_.socketPath());
    ASSERT_TRUE(client.ok());
  }  // closed without sending anything
  std::this_thread::sleep_for(200ms);
  EXPECT_TRUE(sandbox_.running());
  EXPECT_EQ(disconnects(), before + 1);
  EXPECT_EQ(sandbox_.terminate(), 0);
  EXPECT_TRUE(sandbox_.logged("XPC connection will be closed"));
}

TEST_F(ServiceTest, StartUpLogsAndOpensTheDailyLogFile) {
  EXPECT_TRUE(sandbox_.logged(HelperExecutable() + " started"));
  sandbox_.request(Request({{"removeWorkContainer:", XpcObject::String("/private/var/none")}}), 1);
  // The file of the day holds the lines logged after start-up.
  const std::string dir = sandbox_.host("/private/var/logs/vitd");
  const std::string listing = sandbox_.run("/bin/ls", {dir}).output;
  ASSERT_EQ(listing.rfind("vitd_helper-", 0), 0u) << listing;
  const std::string content = ReadFile(dir + "/" + listing.substr(0, listing.find('\n')));
  EXPECT_NE(content.find(" +0000 Entering -[VTRHMessageResponder removeWorkContainer:] with parameter: /private/var/none\n"),
            std::string::npos)
      << content;
  EXPECT_EQ(content.find("started"), std::string::npos);  // written before file logging was on
}

}  // namespace
}  // namespace vtr::testing
