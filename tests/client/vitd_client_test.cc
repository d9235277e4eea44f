// The C client library against a stand-in helper: a listening socket in a
// temporary folder whose accepted end the test writes frames to.
#include "client/vitd_client.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <string>
#include <thread>
#include <vector>

#include "platform/unique_fd.h"
#include "tests/support/test_support.h"
#include "xpc/client.h"
#include "xpc/socket_io.h"
#include "xpc/wire_codec.h"

namespace vtr {
namespace {

using testing::TempDir;

struct JsonText {
  explicit JsonText(const vitd_value* value) : text(vitd_value_to_json(value)) {}
  ~JsonText() { std::free(text); }
  std::string str() const { return text != nullptr ? text : "<null>"; }
  char* text;
};

class VitdClientTest : public ::testing::Test {
 protected:
  void SetUp() override {
    path_ = dir_.path() + "/helper.sock";
    listener_.reset(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    struct sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    ASSERT_LT(path_.size(), sizeof address.sun_path);
    path_.copy(address.sun_path, path_.size());
    ASSERT_EQ(::bind(listener_.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    ASSERT_EQ(::listen(listener_.get(), 4), 0);
    Connect();
  }
  // A new client and the helper's end of it.
  void Connect() {
    vitd_disconnect(client_);
    ASSERT_EQ(vitd_connect(path_.c_str(), &client_), VITD_OK);
    helper_.emplace(UniqueFd(::accept4(listener_.get(), nullptr, nullptr, SOCK_CLOEXEC)));
    ASSERT_GE(helper_->fd(), 0);
    vitd_set_timeout(client_, 2000);
  }
  void TearDown() override { vitd_disconnect(client_); }

  void HelperSends(const XpcObject& message) { ASSERT_TRUE(helper_->send(message).ok()); }
  void HelperSendsBytes(const std::vector<uint8_t>& bytes) {
    ASSERT_EQ(::write(helper_->fd(), bytes.data(), bytes.size()), static_cast<ssize_t>(bytes.size()));
  }
  // Sends bytes from another thread while the client receives; its status.
  int ReceiveWhileHelperSends(const std::vector<uint8_t>& bytes) {
    std::thread writer([&] { EXPECT_TRUE(SendAll(helper_->fd(), bytes, std::chrono::seconds(10)).ok()); });
    const int status = vitd_receive(client_, nullptr, nullptr);
    writer.join();
    return status;
  }
  XpcObject HelperReceives() {
    Result<XpcObject> message = helper_->receive(std::chrono::seconds(2));
    EXPECT_TRUE(message.ok());
    return message.ok() ? *message : XpcObject();
  }

  TempDir dir_;
  std::string path_;
  UniqueFd listener_;
  std::optional<XpcClient> helper_;  // the helper's end, speaking the same codec
  vitd_client* client_ = nullptr;
};

struct Seen {
  std::vector<std::string> lines;
  int stopAfter = 0;  // stop after this many messages (0: never)
};

int Record(const vitd_message* message, void* context) {
  auto* seen = static_cast<Seen*>(context);
  switch (message->kind) {
    case VITD_MESSAGE_RESPONSE:
      seen->lines.push_back("response " + std::to_string(message->response));
      break;
    case VITD_MESSAGE_PROGRESS:
      seen->lines.push_back("progress " + std::to_string(message->progress));
      break;
    case VITD_MESSAGE_DATA:
      seen->lines.push_back("data " + std::string(reinterpret_cast<const char*>(message->data), message->data_size));
      break;
    case VITD_MESSAGE_OTHER:
      seen->lines.push_back("other " + JsonText(message->object).str());
      break;
  }
  return seen->stopAfter != 0 && static_cast<int>(seen->lines.size()) >= seen->stopAfter;
}

TEST_F(VitdClientTest, CallSendsTheCommandAndHandsEveryMessageOverUntilTheResponse) {
  vitd_value* parameter = vitd_dictionary();
  ASSERT_EQ(vitd_dictionary_set(parameter, "Path", vitd_string("/private/var")), VITD_OK);
  ASSERT_EQ(vitd_dictionary_set(parameter, "Inclusive", vitd_bool(0)), VITD_OK);
  HelperSends(XpcObject::Dictionary({{"Progress", XpcObject::Int64(40)}}));
  HelperSends(XpcObject::Dictionary({{"Data", XpcObject::Data({'a', 'b'})}}));
  HelperSends(XpcObject::Dictionary({{"Progress", XpcObject::Int64(100)}, {"Extra", XpcObject::Null()}}));
  HelperSends(XpcObject::Dictionary({{"Response", XpcObject::Bool(false)}}));
  HelperSends(XpcObject::Dictionary({{"Response", XpcObject::Bool(true)}}));

  Seen seen;
  int response = -1;
  ASSERT_EQ(vitd_call(client_, "createDeviceManifest", parameter, Record, &seen, &response), VITD_OK);
  vitd_value_free(parameter);
  EXPECT_EQ(response, 0);
  EXPECT_EQ(seen.lines, (std::vector<std::string>{"progress 40", "data ab", "other {\"Extra\":null,\"Progress\":100}",
                                                  "response 0"}));
  EXPECT_EQ(HelperReceives(),
            XpcObject::Dictionary(
                {{"createDeviceManifest:", XpcObject::Dictionary({{"Path", XpcObject::String("/private/var")},
                                                                  {"Inclusive", XpcObject::Bool(false)}})}}));
  // The next response is the next call's; a command given with its colon and
  // no parameter is sent as "name:": true.
  ASSERT_EQ(vitd_call(client_, "reboot:", nullptr, nullptr, nullptr, &response), VITD_OK);
  EXPECT_EQ(response, 1);
  EXPECT_EQ(HelperReceives(), XpcObject::Dictionary({{"reboot:", XpcObject::Bool(true)}}));
}

TEST_F(VitdClientTest, SilenceClosingBrokenFramesAndAStoppingCallbackEachHaveTheirStatus) {
  vitd_set_timeout(client_, 100);
  EXPECT_EQ(vitd_receive(client_, nullptr, nullptr), VITD_ERROR_TIMEOUT);
  // Still usable after a timeout.
  HelperSends(XpcObject::Dictionary({{"Progress", XpcObject::Int64(1)}}));
  Seen seen{{}, 1};
  EXPECT_EQ(vitd_wait_response(client_, Record, &seen, nullptr), VITD_ERROR_STOPPED);
  // A frame with an unknown tag spends the client: it stays an error.
  HelperSendsBytes({2, 0, 0, 0, 0x0A, 0x7F});
  EXPECT_EQ(vitd_receive(client_, nullptr, nullptr), VITD_ERROR_PROTOCOL);
  HelperSends(XpcObject::Dictionary({{"Response", XpcObject::Bool(true)}}));
  EXPECT_EQ(vitd_receive(client_, nullptr, nullptr), VITD_ERROR_PROTOCOL);
}

TEST_F(VitdClientTest, TheHelperClosingBeforeTheResponseIsToldAndASendAfterItFails) {
  ASSERT_EQ(vitd_send(client_, "quitHelper", nullptr), VITD_OK);
  EXPECT_EQ(HelperReceives(), XpcObject::Dictionary({{"quitHelper:", XpcObject::Bool(true)}}));
  HelperSends(XpcObject::Dictionary({{"Progress", XpcObject::Int64(5)}}));
  helper_.reset();
  int response = -1;
  Seen seen;
  EXPECT_EQ(vitd_wait_response(client_, Record, &seen, &response), VITD_ERROR_CLOSED);
  EXPECT_EQ(seen.lines, std::vector<std::string>{"progress 5"});
  EXPECT_EQ(response, -1);
  EXPECT_EQ(vitd_send(client_, "quitHelper", nullptr), VITD_ERROR_SEND);
}

// A whole 16 MiB frame {"x": [object, object, ...]} of copies of one encoded object.
std::vector<uint8_t> FrameOfMany(const std::vector<uint8_t>& object) {
  const uint8_t head[] = {0x0A, 1, 0, 0, 0, 1, 0, 0, 0, 'x', 0x09};
  const uint32_t count = static_cast<uint32_t>((kMaxFrameBodyBytes - sizeof head - 4) / object.size());
  const uint32_t body = static_cast<uint32_t>(sizeof head + 4 + size_t{count} * object.size());
  std::vector<uint8_t> frame(4 + size_t{body});
  std::memcpy(frame.data(), &body, 4);  // little-endian, as the machine
  std::memcpy(frame.data() + 4, head, sizeof head);
  std::memcpy(frame.data() + 4 + sizeof head, &count, 4);
  for (size_t at = 8 + sizeof head; at < frame.size(); at += object.size()) {
    std::memcpy(frame.data() + at, object.data(), object.size());
  }
  return frame;
}

TEST_F(VitdClientTest, AFrameOverTheLimitsIsNeverDecodedAndSpendsTheClient) {
  const struct {
    const char* name;
    std::vector<uint8_t> frame;
    int status;
  } cases[] = {
      // Each object costs far more than four times its bytes to build.
      {"nulls", FrameOfMany({0x00}), VITD_ERROR_TOO_LARGE},
      {"empty dictionaries", FrameOfMany({0x0A, 0, 0, 0, 0}), VITD_ERROR_TOO_LARGE},
      {"one-byte strings", FrameOfMany({0x07, 1, 0, 0, 0, 'a'}), VITD_ERROR_TOO_LARGE},
      {"a length over 16 MiB", {1, 0, 0, 1, 0x0A}, VITD_ERROR_TOO_LARGE},
      // Dense but within the bound: decoded.
      {"integers", FrameOfMany({0x02, 1, 2, 3, 4, 5, 6, 7, 8}), VITD_OK},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    Connect();
    EXPECT_EQ(ReceiveWhileHelperSends(c.frame), c.status);
    if (c.status == VITD_OK) continue;
    HelperSends(XpcObject::Dictionary({{"Response", XpcObject::Bool(true)}}));
    EXPECT_EQ(vitd_receive(client_, nullptr, nullptr), c.status);
  }
}

TEST(VitdClient, ConnectingWhereNothingListensAndBadArgumentsAreErrors) {
  TempDir dir;
  vitd_client* client = reinterpret_cast<vitd_client*>(1);
  EXPECT_EQ(vitd_connect((dir.path() + "/nobody.sock").c_str(), &client), VITD_ERROR_CONNECT);
  EXPECT_EQ(client, nullptr);
  EXPECT_EQ(vitd_connect(std::string(200, 'x').c_str(), &client), VITD_ERROR_CONNECT);
  EXPECT_EQ(vitd_connect(nullptr, nullptr), VITD_ERROR_INVALID_ARGUMENT);
  EXPECT_EQ(vitd_send(nullptr, "reboot", nullptr), VITD_ERROR_INVALID_ARGUMENT);
  EXPECT_EQ(vitd_set_timeout(nullptr, 5), VITD_ERROR_INVALID_ARGUMENT);
  EXPECT_EQ(vitd_receive(nullptr, nullptr, nullptr), VITD_ERROR_INVALID_ARGUMENT);
  // Adding to something that is not a container frees the item and fails.
  vitd_value* text = vitd_string("x");
  EXPECT_EQ(vitd_array_append(text, vitd_int64(1)), VITD_ERROR_INVALID_ARGUMENT);
  EXPECT_EQ(vitd_dictionary_set(text, "k", vitd_int64(1)), VITD_ERROR_INVALID_ARGUMENT);
  EXPECT_EQ(vitd_dictionary_set(nullptr, "k", vitd_int64(1)), VITD_ERROR_INVALID_ARGUMENT);
  vitd_value_free(text);
  EXPECT_EQ(vitd_string(nullptr), nullptr);
  EXPECT_STREQ(vitd_strerror(VITD_ERROR_TIMEOUT), "no message from the helper in time");
  EXPECT_STREQ(vitd_strerror(12345), "unknown status");
}

TEST_F(VitdClientTest, ARequestMustBeADictionaryAndTooBigAFrameIsRefused) {
  vitd_value* list = vitd_array();
  EXPECT_EQ(vitd_send_request(client_, list), VITD_ERROR_INVALID_ARGUMENT);
  vitd_value_free(list);
  const std::string huge(17 * 1024 * 1024, 'x');
  vitd_value* big = vitd_string(huge.c_str());
  EXPECT_EQ(vitd_send(client_, "removeWorkContainer", big), VITD_ERROR_INVALID_ARGUMENT);
  vitd_value_free(big);
}

TEST(VitdClientValues, BuildParseAndPrint) {
  struct Case {
    const char* json;
    int status;
    const char* printed;  // as vitd_value_to_json prints the parsed value
  };
  const std::string tooDeep = std::string(65, '[') + std::string(65, ']');
  const Case cases[] = {
      {R"({"b":true,"n":null,"i":-3,"u":18446744073709551615,"d":1.5,"s":"\u00e9","a":[1,[2]]})", VITD_OK,
       R"({"a":[1,[2]],"b":true,"d":1.5,"i":-3,"n":null,"s":"é","u":18446744073709551615})"},
      {R"("/private/var/x")", VITD_OK, R"("/private/var/x")"},
      {"[1,", VITD_ERROR_BAD_JSON, nullptr},
      {"", VITD_ERROR_BAD_JSON, nullptr},
      {tooDeep.c_str(), VITD_ERROR_BAD_JSON, nullptr},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.json);
    vitd_value* value = nullptr;
    ASSERT_EQ(vitd_value_from_json(c.json, &value), c.status);
    if (c.printed != nullptr) {
      EXPECT_EQ(JsonText(value).str(), c.printed);
    }
    vitd_value_free(value);
  }

  vitd_value* dict = vitd_dictionary();
  vitd_value* array = vitd_array();
  const unsigned char bytes[] = {0xff, 0x00};
  ASSERT_EQ(vitd_array_append(array, vitd_data(bytes, sizeof bytes)), VITD_OK);
  ASSERT_EQ(vitd_array_append(array, vitd_date(-1)), VITD_OK);
  ASSERT_EQ(vitd_array_append(array, vitd_uint64(7)), VITD_OK);
  ASSERT_EQ(vitd_array_append(array, vitd_double(0.25)), VITD_OK);
  ASSERT_EQ(vitd_dictionary_set(dict, "k", array), VITD_OK);
  ASSERT_EQ(vitd_dictionary_set(dict, "k2", vitd_string("\xff")), VITD_OK);
  ASSERT_EQ(vitd_dictionary_set(dict, "k2", vitd_null()), VITD_OK);  // replaces
  EXPECT_EQ(vitd_value_type(dict), VITD_TYPE_DICTIONARY);
  EXPECT_EQ(vitd_value_count(dict), 2u);
  EXPECT_STREQ(vitd_dictionary_key(dict, 1), "k2");
  EXPECT_EQ(vitd_dictionary_key(dict, 2), nullptr);
  EXPECT_EQ(JsonText(dict).str(), R"({"k":["/wA=",-1,7,0.25],"k2":null})");
  vitd_value_free(dict);
  vitd_value* invalid = vitd_string("a\xff");
  EXPECT_EQ(vitd_dictionary_key(invalid, 0), nullptr);
  EXPECT_EQ(JsonText(invalid).str(), "\"a\xef\xbf\xbd\"");
  vitd_value_free(invalid);
}

}  // namespace
}  // namespace vtr
