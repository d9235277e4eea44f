// Firmware variables, reboot and quit, end to end in a sandbox root: the
// variables live in a plain folder there (real firmware: tests/firmware).
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

#include <gtest/gtest.h>

#include "platform/make_directories.h"
#include "tests/support/file_inspection.h"
#include "tests/support/test_support.h"
#include "tests/vitd_helper/helper_sandbox.h"

namespace vtr::testing {
namespace {

constexpr char kEfivars[] = "/sys/firmware/efi/efivars";
constexpr char kSuffix[] = "-da3c1531-e7a2-45a1-875c-5c2980f00b0d";

class PowerTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (!IsRoot()) GTEST_SKIP() << "the helper chroots into its sandbox root: needs root";
    ASSERT_TRUE(MakeDirectories(sandbox_.host(kEfivars)).ok());
  }

  std::optional<bool> command(const std::string& key, XpcObject parameter) {
    std::vector<XpcObject> replies = sandbox_.request(XpcObject::Dictionary({{key, std::move(parameter)}}), 1);
    if (replies.size() != 1 || replies[0].find("Response") == nullptr) return std::nullopt;
    return replies[0].find("Response")->boolValue();
  }
  std::optional<bool> write(XpcObject name, XpcObject value) {
    return command("writeNvram:", XpcObject::Dictionary({{"Name", std::move(name)}, {"Value", std::move(value)}}));
  }
  std::string variable(const std::string& name) const { return sandbox_.host(kEfivars) + "/" + name + kSuffix; }

  HelperSandbox sandbox_;
};

TEST_F(PowerTest, VariablesAreWrittenReadBackAndDeleted) {
  ASSERT_TRUE(sandbox_.start()) << sandbox_.log();
  const std::string attributes("\x07\x00\x00\x00", 4);
  EXPECT_EQ(write(XpcObject::String("demo-mode"), XpcObject::String("a longer first value")), true);
  EXPECT_EQ(write(XpcObject::String("demo-mode"), XpcObject::String("on")), true);
  EXPECT_EQ(ReadFile(variable("demo-mode")), attributes + "on");
  EXPECT_EQ(write(XpcObject::String("greeting"), XpcObject::String("gr\xc3\xbc\xc3\x9f dich \xe2\x9c\x93")), true);
  EXPECT_EQ(ReadFile(variable("greeting")), attributes + "gr\xc3\xbc\xc3\x9f dich \xe2\x9c\x93");
  // The entry line is in the day log before the reply comes.
  EXPECT_NE(ReadFile(sandbox_.dayLogPath()).find("Entering -[VTRHMessageResponder writeNvram:] with parameter:"),
            std::string::npos);

  EXPECT_EQ(write(XpcObject::String("greeting"), XpcObject::String("")), true);  // empty: no variable
  EXPECT_FALSE(Exists(variable("greeting")));
  EXPECT_EQ(command("deleteNvram:", XpcObject::String("demo-mode")), true);
  EXPECT_FALSE(Exists(variable("demo-mode")));
  EXPECT_EQ(command("deleteNvram:", XpcObject::String("demo-mode")), true);  // already gone

  // vitdctl lists what is there, as text and as JSON.
  EXPECT_EQ(write(XpcObject::String("shown"), XpcObject::String("v\"1")), true);
  HelperSandbox::RunResult listed = sandbox_.run(VitdctlExecutable(), {"--root", sandbox_.root(), "listNvram"});
  EXPECT_EQ(listed.status, 0);
  EXPECT_EQ(listed.output, "shown = \"v\"1\"\n");
  listed = sandbox_.run(VitdctlExecutable(), {"--root", sandbox_.root(), "listNvram", "--json"});
  EXPECT_NE(listed.output.find("\"value\": \"v\\\"1\""), std::string::npos) << listed.output;
}

TEST_F(PowerTest, WhatIsNoVariableNameWritesNothingAnywhere) {
  ASSERT_TRUE(sandbox_.start()) << sandbox_.log();
  WriteFile(sandbox_.host("/private/var/keep"), "keep");
  const struct {
    const char* what;
    XpcObject name;
  } names[] = {
      {"absolute", XpcObject::String("/private/var/keep")},
      {"slash", XpcObject::String("../../../private/var/keep")},
      {"empty", XpcObject::String("")},
      {"too long", XpcObject::String(std::string(219, 'n'))},
      {"not a string", XpcObject::Int64(7)},
  };
  for (const auto& c : names) {
    EXPECT_EQ(write(c.name, XpcObject::String("x")), false) << c.what;
    EXPECT_EQ(command("deleteNvram:", c.name), false) << c.what;
  }
  EXPECT_EQ(command("writeNvram:", XpcObject::Dictionary({{"Value", XpcObject::String("x")}})), false);
  EXPECT_EQ(command("writeNvram:", XpcObject::Dictionary({{"Name", XpcObject::String("no-value")}})), false);
  EXPECT_EQ(ReadFile(sandbox_.host("/private/var/keep")), "keep");
  EXPECT_TRUE(std::filesystem::is_empty(sandbox_.host(kEfivars)));
  EXPECT_TRUE(sandbox_.logged("Couldn't write nvram"));
  EXPECT_TRUE(sandbox_.logged("Couldn't force sync new nvram to device"));
  // A NUL cannot even be sent: the wire refuses strings holding one.
}

TEST_F(PowerTest, WithoutTheFolderThereIsNoOptionsNodeAndNothingIsMade) {
  std::filesystem::remove_all(sandbox_.host("/sys"));
  ASSERT_TRUE(sandbox_.start()) << sandbox_.log();
  EXPECT_EQ(write(XpcObject::String("a"), XpcObject::String("b")), false);
  EXPECT_EQ(command("deleteNvram:", XpcObject::String("a")), false);
  EXPECT_TRUE(sandbox_.logged("Couldn't locate options node in IODeviceTree"));
  EXPECT_FALSE(Exists(sandbox_.host("/sys")));

  // A link where the folder should be is no folder either.
  ASSERT_TRUE(MakeDirectories(sandbox_.host("/sys/firmware/efi")).ok());
  ASSERT_TRUE(MakeDirectories(sandbox_.host("/private/var/fake")).ok());
  ASSERT_EQ(::symlink("/private/var/fake", sandbox_.host(kEfivars).c_str()), 0);
  EXPECT_EQ(write(XpcObject::String("a"), XpcObject::String("b")), false);
  EXPECT_TRUE(std::filesystem::is_empty(sandbox_.host("/private/var/fake")));
}

TEST_F(PowerTest, QuitEndsTheHelperWithoutAReply) {
  ASSERT_TRUE(sandbox_.start()) << sandbox_.log();
  HelperSandbox::RunResult quit =
      sandbox_.run(VitdctlExecutable(), {"--root", sandbox_.root(), "--timeout", "10", "quitHelper"});
  EXPECT_EQ(quit.status, 0);
  EXPECT_EQ(quit.output, "");  // no reply came
  EXPECT_EQ(sandbox_.waitForExit(std::chrono::seconds(5)), 0);
  EXPECT_NE(ReadFile(sandbox_.dayLogPath()).find("Entering -[VTRHMessageResponder quitHelper:] with parameter:"),
            std::string::npos);
}

TEST_F(PowerTest, RebootEndsOnlyThePidNamespaceTheHelperIsFirstIn) {
  // Not the first process of its namespace: the call is not made.
  ASSERT_TRUE(sandbox_.start()) << sandbox_.log();
  EXPECT_EQ(command("reboot:", XpcObject::Bool(true)), false);
  EXPECT_TRUE(sandbox_.logged(
      "Not rebooting: the helper runs in a sandbox root and is not the first process of its own PID namespace"));
  EXPECT_TRUE(sandbox_.running());
  EXPECT_EQ(sandbox_.terminate(), 0);

  // PID 1 of its own namespace: the kernel ends the namespace, and its first
  // process dies by SIGHUP, the signal of a restart. The client must live in
  // that namespace too, so that the helper can see who it is.
  if (::access("/usr/bin/nsenter", X_OK) != 0) GTEST_SKIP() << "no /usr/bin/nsenter (util-linux) to enter the namespace";
  HelperSandbox contained;
  ASSERT_TRUE(MakeDirectories(contained.host(kEfivars)).ok());
  ASSERT_TRUE(contained.start(/*ownPidNamespace=*/true)) << contained.log();
  const std::string pidNamespace = "--pid=/proc/" + std::to_string(contained.pid()) + "/ns/pid";
  HelperSandbox::RunResult rebooted =
      contained.run("/usr/bin/nsenter", {pidNamespace, "--", VitdctlExecutable(), "--root", contained.root(),
                                         "--timeout", "10", "reboot"});
  // The client, inside the namespace, ends with it; no answer came first.
  EXPECT_EQ(rebooted.output, "") << contained.log();
  EXPECT_EQ(contained.waitForExit(std::chrono::seconds(5)), -1);
  EXPECT_EQ(contained.endingSignal(), SIGHUP) << contained.log();
  EXPECT_NE(ReadFile(contained.dayLogPath()).find("Entering -[VTRHMessageResponder reboot:] with parameter:"),
            std::string::npos);
}

}  // namespace
}  // namespace vtr::testing
