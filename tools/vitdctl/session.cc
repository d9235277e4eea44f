#include "tools/vitdctl/session.h"

#include <nlohmann/json.hpp>

#include <cerrno>

#include "platform/base64.h"
#include "xpc/client.h"

namespace vtr::vitdctl {
namespace {

using Json = nlohmann::json;

std::string Base64(const XpcBytes& bytes) {
  std::string out;
  AppendBase64(bytes, &out);
  return out;
}

Json ToJson(const XpcObject& object) {
  switch (object.type()) {
    case XpcObject::Type::kNull: return nullptr;
    case XpcObject::Type::kBool: return *object.boolValue();
    case XpcObject::Type::kInt64: return *object.int64Value();
    case XpcObject::Type::kUint64: return *object.uint64Value();
    case XpcObject::Type::kDouble: return *object.doubleValue();
    case XpcObject::Type::kDate: return *object.dateValue();
    case XpcObject::Type::kData: return Base64(*object.data());
    case XpcObject::Type::kString: return *object.string();
    case XpcObject::Type::kUuid: {
      const XpcUuid uuid = *object.uuidValue();
      return Base64(XpcBytes(uuid.begin(), uuid.end()));
    }
    case XpcObject::Type::kArray: {
      Json array = Json::array();
      for (const XpcObject& item : *object.array()) array.push_back(ToJson(item));
      return array;
    }
    case XpcObject::Type::kDictionary: {
      Json dict = Json::object();
      for (const auto& [key, item] : *object.dictionary()) dict[key] = ToJson(item);
      return dict;
    }
  }
  return nullptr;
}

void DrawProgress(FILE* out, int64_t percent) {
  constexpr int kWidth = 40;
  const int64_t shown = percent < 0 ? 0 : (percent > 100 ? 100 : percent);
  const int filled = static_cast<int>(shown * kWidth / 100);
  std::fprintf(out, "\r[%s%s] %3lld%%", std::string(filled, '#').c_str(), std::string(kWidth - filled, '-').c_str(),
               static_cast<long long>(percent));
  std::fflush(out);
}

}  // namespace

std::string MessageAsJson(const XpcObject& message) {
  return ToJson(message).dump(-1, ' ', false, Json::error_handler_t::replace);
}

int RunSession(const SessionOptions& options, const XpcObject& request, FILE* out) {
  Result<XpcClient> client = XpcClient::Connect(options.socketPath);
  if (!client.ok()) {
    std::fprintf(stderr, "vitdctl: cannot connect to %s: %s\n", options.socketPath.c_str(),
                 client.error().description().c_str());
    return kCannotConnect;
  }
  if (Status sent = client->send(request); !sent.ok()) {
    std::fprintf(stderr, "vitdctl: cannot send the request: %s\n", sent.error().description().c_str());
    return kCannotConnect;
  }

  const size_t expected = request.dictionary() ? request.dictionary()->size() : 0;
  size_t responses = 0;
  bool allTrue = true;
  bool barShown = false;
  while (responses < expected) {
    Result<XpcObject> message = client->receive(options.timeout);
    if (!message.ok()) {
      if (barShown) std::fputc('\n', out);
      const bool timedOut = message.error().code() == ETIMEDOUT;
      if (options.closeIsSuccess && !timedOut && responses == 0) {
        std::fprintf(stderr, "vitdctl: the helper ended the connection without a reply, as this command does\n");
        return kAllTrue;
      }
      std::fprintf(stderr, "vitdctl: %s after %zu of %zu responses\n",
                   timedOut ? "no answer in time" : "the helper closed the connection", responses, expected);
      return kIncomplete;
    }
    const XpcObject* progress = message->find("Progress");
    if (options.progressBar && progress != nullptr && progress->int64Value()) {
      DrawProgress(out, *progress->int64Value());
      barShown = true;
      continue;
    }
    if (barShown) {
      std::fputc('\n', out);
      barShown = false;
    }
    std::fprintf(out, "%s\n", MessageAsJson(*message).c_str());
    std::fflush(out);
    if (const XpcObject* response = message->find("Response")) {
      ++responses;
      if (response->boolValue() != true) allTrue = false;
    }
  }
  return allTrue ? kAllTrue : kSomeFalse;
}

}  // namespace vtr::vitdctl
