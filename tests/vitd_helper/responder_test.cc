// The command core without a socket: a request and a peer in, replies out.
#include "vitd_helper/message_responder.h"

#include <gtest/gtest.h>

#include "tests/support/test_support.h"

namespace vtr::testing {
namespace {

// A peer that is no process: its entitlements are given, its replies kept.
class FakePeer : public MessagePeer {
 public:
  explicit FakePeer(Value entitlements) : entitlements_(std::move(entitlements)) {}
  Result<SecTask> copyTask() const override { return SecTask::WithEntitlements(entitlements_); }
  Status send(const XpcObject& message) override {
    sent.push_back(message);
    return Status::Ok();
  }
  std::vector<XpcObject> sent;

 private:
  Value entitlements_;
};

XpcObject Response(bool value) { return XpcObject::Dictionary({{"Response", XpcObject::Bool(value)}}); }

TEST(ResponderTest, EntitledRequestsAreAnsweredInKeyOrderUntilAnUnknownKey) {
  LogCapture log;
  auto peer = std::make_shared<FakePeer>(Value::DictionaryOf({{kVitrelldEntitlement, Value::Boolean(true)}}));
  VTRHMessageResponder& responder = VTRHMessageResponder::sharedInstance();
  responder.setConnection(peer);
  // Paths refused before the disk is touched: the host is never changed.
  responder.handleXPCMessage(XpcObject::Dictionary({{"removeWorkContainer:", XpcObject::String("relative")},
                                                    {"prepareWorkContainer:", XpcObject::String("/etc")},
                                                    {"sendPassResponse", XpcObject::Bool(true)},
                                                    {"zzz:", XpcObject::Bool(true)}}));
  EXPECT_EQ(peer->sent, (std::vector<XpcObject>{Response(false), Response(false)}));
  EXPECT_TRUE(log.contains("Refused path relative: not an absolute path"));
  EXPECT_TRUE(log.contains("Refused path /etc: outside the client areas"));
  EXPECT_TRUE(log.contains("VTRHMessageResponder does not respond to sendPassResponse."));
  EXPECT_FALSE(log.contains("VTRHMessageResponder does not respond to zzz:."));
}

TEST(ResponderTest, AContainerTypeOrIdentifierThatIsNoStringNamesNoManifest) {
  auto peer = std::make_shared<FakePeer>(Value::DictionaryOf({{kVitrelldEntitlement, Value::Boolean(true)}}));
  VTRHMessageResponder::sharedInstance().setConnection(peer);
  const struct {
    XpcObject type, identifier;
    const char* refusal;  // null: the whole device, whose manifest path is then refused
  } cases[] = {
      {XpcObject::Int64(5), XpcObject::String("com.example"), "Couldn't load manifest dict for 5/com.example"},
      {XpcObject::String("AppData"), XpcObject::Int64(5), "Couldn't load manifest dict for AppData/5"},
      {XpcObject::Null(), XpcObject::Int64(5), "Couldn't load manifest dict for (null)/5"},
      {XpcObject::Null(), XpcObject::String("com.example"), nullptr},
  };
  for (const auto& c : cases) {
    LogCapture log;
    peer->sent.clear();
    VTRHMessageResponder::sharedInstance().handleXPCMessage(XpcObject::Dictionary(
        {{"restoreAttributes:", XpcObject::Dictionary({{"ContentType", c.type},
                                                       {"Identifier", c.identifier},
                                                       {"ManifestPath", XpcObject::String("relative")},
                                                       {"StagingRootPath", XpcObject::String("relative")}})}}));
    EXPECT_EQ(peer->sent, std::vector<XpcObject>{Response(false)});
    if (c.refusal) {
      EXPECT_TRUE(log.contains(c.refusal)) << c.refusal;
    }
    EXPECT_EQ(log.contains("Refused path relative: not an absolute path"), c.refusal == nullptr);
  }
}

TEST(ResponderTest, OnlyABooleanTrueEntitlementIsServed) {
  const struct {
    Value entitlement;
    const char* why;
  } refused[] = {
      {Value::Boolean(false), nullptr},
      {Value::String("true"), "-[VTRHMessageResponder hasEntitlementVitrelld]: format not correct: true"},
      {Value::Integer(1), "-[VTRHMessageResponder hasEntitlementVitrelld]: format not correct: 1"},
      {Value(), "-[VTRHMessageResponder hasEntitlementVitrelld]: No data received."},
  };
  for (const auto& c : refused) {
    LogCapture log;
    Value entitlements =
        c.entitlement.isNil() ? Value::DictionaryOf(Dictionary()) : Value::DictionaryOf({{kVitrelldEntitlement, c.entitlement}});
    auto peer = std::make_shared<FakePeer>(entitlements);
    VTRHMessageResponder::sharedInstance().setConnection(peer);
    VTRHMessageResponder::sharedInstance().handleXPCMessage(
        XpcObject::Dictionary({{"removeWorkContainer:", XpcObject::String("relative")}}));
    EXPECT_TRUE(peer->sent.empty());
    EXPECT_TRUE(log.contains("The client does not have proper entitlement"));
    if (c.why) {
      EXPECT_TRUE(log.contains(c.why)) << c.why;
    }
  }
  // A peer that has gone: its replies are dropped.
  VTRHMessageResponder::sharedInstance().setConnection({});
  VTRHMessageResponder::sharedInstance().sendPassResponse();
}

}  // namespace
}  // namespace vtr::testing
