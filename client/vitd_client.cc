// The C client library on top of the message service's own client and
// codec: the same frames and limits as the helper, behind a C interface that
// never lets an exception out.
#include "client/vitd_client.h"

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <new>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/base64.h"
#include "xpc/client.h"
#include "xpc/message_validator.h"
#include "xpc/wire_codec.h"

static_assert(VITD_MAX_FRAME_BYTES == vtr::kMaxFrameBodyBytes);
static_assert(VITD_MAX_DECODE_FACTOR == vtr::kDecodeCostFactor);

// A value under construction: containers collect their items until the
// value is sent or read, scalars and received values are finished objects.
struct vitd_value {
  vtr::XpcObject object;
  std::optional<vtr::XpcArray> items;
  std::optional<vtr::XpcDictionary> entries;

  vtr::XpcObject built() const {
    if (items) return vtr::XpcObject::Array(*items);
    if (entries) return vtr::XpcObject::Dictionary(*entries);
    return object;
  }
};

struct vitd_client {
  explicit vitd_client(vtr::XpcClient connection) : connection(std::move(connection)) {}
  vtr::XpcClient connection;
  std::chrono::milliseconds timeout{VITD_DEFAULT_TIMEOUT_MS};
};

namespace {

using Json = nlohmann::json;

// Deepest JSON nesting accepted (the helper takes 64 levels).
constexpr int kMaxJsonDepth = 64;

// Runs body, turning an exhausted allocator into a status: nothing may
// throw across the C interface.
template <typename Body>
auto Guarded(Body body, decltype(body()) onNoMemory) -> decltype(body()) {
  try {
    return body();
  } catch (const std::bad_alloc&) {
    return onNoMemory;
  }
}

vitd_value* NewValue(vtr::XpcObject object) {
  return Guarded([&]() -> vitd_value* { return new vitd_value{std::move(object), {}, {}}; }, nullptr);
}

// A scalar or a string as JSON prints it (invalid UTF-8 replaced).
template <typename T>
void PutJson(const T& value, FILE* out) {
  std::fputs(Json(value).dump(-1, ' ', false, Json::error_handler_t::replace).c_str(), out);
}

// bytes in base64, quoted, a slice at a time: no copy of the whole text.
void PutBase64(std::span<const uint8_t> bytes, FILE* out) {
  constexpr size_t kSlice = 3 * 16384;  // whole groups of three: no padding midway
  std::string text;
  std::fputc('"', out);
  for (size_t at = 0; at < bytes.size(); at += kSlice) {
    text.clear();
    vtr::AppendBase64(bytes.subspan(at, std::min(kSlice, bytes.size() - at)), &text);
    std::fputs(text.c_str(), out);
  }
  std::fputc('"', out);
}

// Writes object to out as one line of JSON, dictionary keys in sorted order,
// straight from the object: the text of a large message costs only itself,
// never a JSON tree and copies of it besides.
void PutJson(const vtr::XpcObject& object, FILE* out) {
  using Type = vtr::XpcObject::Type;
  switch (object.type()) {
    case Type::kNull:
      std::fputs("null", out);
      return;
    case Type::kBool:
      std::fputs(*object.boolValue() ? "true" : "false", out);
      return;
    case Type::kInt64:
      return PutJson(*object.int64Value(), out);
    case Type::kUint64:
      return PutJson(*object.uint64Value(), out);
    case Type::kDouble:
      return PutJson(*object.doubleValue(), out);
    case Type::kDate:
      return PutJson(*object.dateValue(), out);
    case Type::kData:
      return PutBase64(*object.data(), out);
    case Type::kString:
      return PutJson(*object.string(), out);
    case Type::kUuid: {
      const vtr::XpcUuid uuid = *object.uuidValue();
      return PutBase64(uuid, out);
    }
    case Type::kArray: {
      const char* separator = "";
      std::fputc('[', out);
      for (const vtr::XpcObject& item : *object.array()) {
        std::fputs(std::exchange(separator, ","), out);
        PutJson(item, out);
      }
      std::fputc(']', out);
      return;
    }
    case Type::kDictionary: {
      std::vector<const vtr::XpcDictionary::Entry*> entries;
      entries.reserve(object.dictionary()->size());
      for (const vtr::XpcDictionary::Entry& entry : *object.dictionary()) entries.push_back(&entry);
      std::sort(entries.begin(), entries.end(), [](const auto* a, const auto* b) { return a->first < b->first; });
      const char* separator = "";
      std::fputc('{', out);
      for (const vtr::XpcDictionary::Entry* entry : entries) {
        std::fputs(std::exchange(separator, ","), out);
        PutJson(entry->first, out);
        std::fputc(':', out);
        PutJson(entry->second, out);
      }
      std::fputc('}', out);
      return;
    }
  }
}

// Where WriteJsonTo puts the text: into text (capacity bytes), or, while
// text is null, nowhere (it only counts).
struct JsonSink {
  char* text = nullptr;
  size_t capacity = 0;
  size_t length = 0;
};

ssize_t WriteToSink(void* cookie, const char* bytes, size_t size) {
  auto* sink = static_cast<JsonSink*>(cookie);
  if (sink->text != nullptr) {
    if (size > sink->capacity - sink->length) return 0;  // an error for stdio
    std::memcpy(sink->text + sink->length, bytes, size);
  }
  sink->length += size;
  return static_cast<ssize_t>(size);
}

// Writes object as JSON into sink; false when a write failed.
bool WriteJsonTo(const vtr::XpcObject& object, JsonSink* sink) {
  FILE* out = ::fopencookie(sink, "w", cookie_io_functions_t{nullptr, WriteToSink, nullptr, nullptr});
  if (out == nullptr) return false;
  try {
    PutJson(object, out);
  } catch (...) {
    std::fclose(out);
    throw;
  }
  const bool written = std::ferror(out) == 0;
  return std::fclose(out) == 0 && written;
}

std::optional<vtr::XpcObject> FromJson(const Json& json, int depth) {
  if (depth > kMaxJsonDepth) return std::nullopt;
  switch (json.type()) {
    case Json::value_t::null:
      return vtr::XpcObject::Null();
    case Json::value_t::boolean:
      return vtr::XpcObject::Bool(json.get<bool>());
    case Json::value_t::number_integer:
      return vtr::XpcObject::Int64(json.get<int64_t>());
    case Json::value_t::number_unsigned: {
      const uint64_t u = json.get<uint64_t>();
      return u <= static_cast<uint64_t>(INT64_MAX) ? vtr::XpcObject::Int64(static_cast<int64_t>(u))
                                                   : vtr::XpcObject::Uint64(u);
    }
    case Json::value_t::number_float:
      return vtr::XpcObject::Double(json.get<double>());
    case Json::value_t::string:
      return vtr::XpcObject::String(json.get<std::string>());
    case Json::value_t::array: {
      vtr::XpcArray items;
      for (const Json& item : json) {
        std::optional<vtr::XpcObject> converted = FromJson(item, depth + 1);
        if (!converted) return std::nullopt;
        items.push_back(std::move(*converted));
      }
      return vtr::XpcObject::Array(std::move(items));
    }
    case Json::value_t::object: {
      vtr::XpcDictionary dict;
      for (const auto& [key, item] : json.items()) {
        std::optional<vtr::XpcObject> converted = FromJson(item, depth + 1);
        if (!converted) return std::nullopt;
        dict.set(key, std::move(*converted));
      }
      return vtr::XpcObject::Dictionary(std::move(dict));
    }
    default:
      return std::nullopt;
  }
}

int StatusOfReceiveError(int code) {
  switch (code) {
    case ETIMEDOUT:
      return VITD_ERROR_TIMEOUT;
    case EPROTO:
      return VITD_ERROR_PROTOCOL;
    case EMSGSIZE:
      return VITD_ERROR_TOO_LARGE;
    case ENOMEM:
      return VITD_ERROR_NO_MEMORY;
    default:
      return VITD_ERROR_CLOSED;
  }
}

// Describes message for a callback; the pointers stay valid while message
// and holder live.
vitd_message Describe(const vtr::XpcObject& message, const vitd_value* holder) {
  vitd_message out = {};
  out.kind = VITD_MESSAGE_OTHER;
  out.object = holder;
  const vtr::XpcDictionary* dict = message.dictionary();
  if (dict == nullptr || dict->size() != 1) return out;
  if (const vtr::XpcObject* response = message.find("Response"); response && response->boolValue()) {
    out.kind = VITD_MESSAGE_RESPONSE;
    out.response = *response->boolValue() ? 1 : 0;
  } else if (const vtr::XpcObject* progress = message.find("Progress"); progress && progress->int64Value()) {
    out.kind = VITD_MESSAGE_PROGRESS;
    out.progress = *progress->int64Value();
  } else if (const vtr::XpcObject* data = message.find("Data"); data && data->data()) {
    out.kind = VITD_MESSAGE_DATA;
    out.data = data->data()->data();
    out.data_size = data->data()->size();
  }
  return out;
}

// Receives one message and hands it to callback. *seen tells which kind it
// was (VITD_MESSAGE_OTHER when none came); its pointers die on return.
int ReceiveOne(vitd_client* client, vitd_message_callback callback, void* context, vitd_message* seen) {
  seen->kind = VITD_MESSAGE_OTHER;
  vtr::Result<vtr::XpcObject> message = client->connection.receive(client->timeout);
  if (!message.ok()) return StatusOfReceiveError(message.error().code());
  vitd_value holder{std::move(message).value(), {}, {}};
  *seen = Describe(holder.object, &holder);
  if (callback != nullptr && callback(seen, context) != 0) return VITD_ERROR_STOPPED;
  return VITD_OK;
}

}  // namespace

extern "C" {

const char* vitd_strerror(int status) {
  switch (status) {
    case VITD_OK:
      return "success";
    case VITD_ERROR_INVALID_ARGUMENT:
      return "invalid argument";
    case VITD_ERROR_CONNECT:
      return "cannot connect to the helper's socket";
    case VITD_ERROR_SEND:
      return "cannot send the request to the helper";
    case VITD_ERROR_TIMEOUT:
      return "no message from the helper in time";
    case VITD_ERROR_CLOSED:
      return "the helper closed the connection";
    case VITD_ERROR_PROTOCOL:
      return "the helper sent a message that breaks the protocol";
    case VITD_ERROR_NO_MEMORY:
      return "out of memory";
    case VITD_ERROR_STOPPED:
      return "stopped by the message callback";
    case VITD_ERROR_BAD_JSON:
      return "not JSON (or nested deeper than 64 levels)";
    case VITD_ERROR_TOO_LARGE:
      return "the helper sent a message larger than 16 MiB or one that would take more than four times its size to "
             "decode";
    default:
      return "unknown status";
  }
}

vitd_value* vitd_null(void) { return NewValue(vtr::XpcObject::Null()); }
vitd_value* vitd_bool(int value) { return NewValue(vtr::XpcObject::Bool(value != 0)); }
vitd_value* vitd_int64(int64_t value) { return NewValue(vtr::XpcObject::Int64(value)); }
vitd_value* vitd_uint64(uint64_t value) { return NewValue(vtr::XpcObject::Uint64(value)); }
vitd_value* vitd_double(double value) { return NewValue(vtr::XpcObject::Double(value)); }
vitd_value* vitd_date(int64_t nanoseconds) { return NewValue(vtr::XpcObject::Date(nanoseconds)); }

vitd_value* vitd_data(const void* bytes, size_t size) {
  if (bytes == nullptr && size != 0) return nullptr;
  return Guarded(
      [&]() -> vitd_value* {
        const auto* first = static_cast<const uint8_t*>(bytes);
        return NewValue(vtr::XpcObject::Data(size == 0 ? vtr::XpcBytes() : vtr::XpcBytes(first, first + size)));
      },
      nullptr);
}

vitd_value* vitd_string(const char* text) {
  if (text == nullptr) return nullptr;
  return Guarded([&]() -> vitd_value* { return NewValue(vtr::XpcObject::String(text)); }, nullptr);
}

vitd_value* vitd_array(void) {
  return Guarded([]() -> vitd_value* { return new vitd_value{{}, vtr::XpcArray(), {}}; }, nullptr);
}

vitd_value* vitd_dictionary(void) {
  return Guarded([]() -> vitd_value* { return new vitd_value{{}, {}, vtr::XpcDictionary()}; }, nullptr);
}

int vitd_array_append(vitd_value* array, vitd_value* item) {
  std::unique_ptr<vitd_value> owned(item);
  if (array == nullptr || item == nullptr || !array->items) return VITD_ERROR_INVALID_ARGUMENT;
  return Guarded(
      [&] {
        array->items->push_back(item->built());
        return static_cast<int>(VITD_OK);
      },
      VITD_ERROR_NO_MEMORY);
}

int vitd_dictionary_set(vitd_value* dictionary, const char* key, vitd_value* item) {
  std::unique_ptr<vitd_value> owned(item);
  if (dictionary == nullptr || key == nullptr || item == nullptr || !dictionary->entries) {
    return VITD_ERROR_INVALID_ARGUMENT;
  }
  return Guarded(
      [&] {
        dictionary->entries->set(key, item->built());
        return static_cast<int>(VITD_OK);
      },
      VITD_ERROR_NO_MEMORY);
}

int vitd_value_from_json(const char* text, vitd_value** value) {
  if (text == nullptr || value == nullptr) return VITD_ERROR_INVALID_ARGUMENT;
  return Guarded(
      [&]() -> int {
        const Json json = Json::parse(text, nullptr, /*allow_exceptions=*/false);
        if (json.is_discarded()) return VITD_ERROR_BAD_JSON;
        std::optional<vtr::XpcObject> object = FromJson(json, 1);
        if (!object) return VITD_ERROR_BAD_JSON;
        *value = NewValue(std::move(*object));
        return *value != nullptr ? VITD_OK : VITD_ERROR_NO_MEMORY;
      },
      VITD_ERROR_NO_MEMORY);
}

vitd_type vitd_value_type(const vitd_value* value) {
  if (value == nullptr) return VITD_TYPE_NULL;
  if (value->items) return VITD_TYPE_ARRAY;
  if (value->entries) return VITD_TYPE_DICTIONARY;
  return static_cast<vitd_type>(value->object.type());
}

size_t vitd_value_count(const vitd_value* value) {
  if (value == nullptr) return 0;
  if (value->items) return value->items->size();
  if (value->entries) return value->entries->size();
  if (const vtr::XpcArray* array = value->object.array()) return array->size();
  if (const vtr::XpcDictionary* dict = value->object.dictionary()) return dict->size();
  return 0;
}

const char* vitd_dictionary_key(const vitd_value* value, size_t index) {
  if (value == nullptr) return nullptr;
  const vtr::XpcDictionary* dict = value->entries ? &*value->entries : value->object.dictionary();
  if (dict == nullptr || index >= dict->size()) return nullptr;
  return (dict->begin() + static_cast<std::ptrdiff_t>(index))->first.c_str();
}

char* vitd_value_to_json(const vitd_value* value) {
  if (value == nullptr) return nullptr;
  return Guarded(
      [&]() -> char* {
        // Measured first, then written into a buffer of that size: a text
        // grown as it is written would hold two copies of itself at times.
        const vtr::XpcObject object = value->built();
        JsonSink measure;
        if (!WriteJsonTo(object, &measure)) return nullptr;
        JsonSink sink{static_cast<char*>(std::malloc(measure.length + 1)), measure.length + 1, 0};
        if (sink.text == nullptr) return nullptr;
        if (!WriteJsonTo(object, &sink) || sink.length != measure.length) {
          std::free(sink.text);
          return nullptr;
        }
        sink.text[sink.length] = '\0';
        return sink.text;
      },
      nullptr);
}

void vitd_value_free(vitd_value* value) { delete value; }

int vitd_connect(const char* socket_path, vitd_client** client) {
  if (client == nullptr) return VITD_ERROR_INVALID_ARGUMENT;
  *client = nullptr;
  return Guarded(
      [&]() -> int {
        vtr::Result<vtr::XpcClient> connection =
            vtr::XpcClient::Connect(socket_path != nullptr ? socket_path : VITD_HELPER_SOCKET);
        if (!connection.ok()) return VITD_ERROR_CONNECT;
        *client = new vitd_client(std::move(connection).value());
        return VITD_OK;
      },
      VITD_ERROR_NO_MEMORY);
}

void vitd_disconnect(vitd_client* client) { delete client; }

int vitd_set_timeout(vitd_client* client, int milliseconds) {
  if (client == nullptr || milliseconds <= 0) return VITD_ERROR_INVALID_ARGUMENT;
  client->timeout = std::chrono::milliseconds(milliseconds);
  return VITD_OK;
}

int vitd_send_request(vitd_client* client, const vitd_value* request) {
  if (client == nullptr || vitd_value_type(request) != VITD_TYPE_DICTIONARY) return VITD_ERROR_INVALID_ARGUMENT;
  return Guarded(
      [&]() -> int {
        vtr::Status sent = client->connection.send(request->built());
        if (sent.ok()) return VITD_OK;
        return sent.error().code() == EINVAL || sent.error().code() == EMSGSIZE ? VITD_ERROR_INVALID_ARGUMENT
                                                                                : VITD_ERROR_SEND;
      },
      VITD_ERROR_NO_MEMORY);
}

int vitd_send(vitd_client* client, const char* command, const vitd_value* parameter) {
  if (client == nullptr || command == nullptr || *command == '\0') return VITD_ERROR_INVALID_ARGUMENT;
  return Guarded(
      [&]() -> int {
        std::string key = command;
        if (key.back() != ':') key += ':';
        vitd_value request{{}, {}, vtr::XpcDictionary()};
        request.entries->set(key, parameter != nullptr ? parameter->built() : vtr::XpcObject::Bool(true));
        return vitd_send_request(client, &request);
      },
      VITD_ERROR_NO_MEMORY);
}

int vitd_receive(vitd_client* client, vitd_message_callback callback, void* context) {
  if (client == nullptr) return VITD_ERROR_INVALID_ARGUMENT;
  vitd_message seen;
  return Guarded([&] { return ReceiveOne(client, callback, context, &seen); }, VITD_ERROR_NO_MEMORY);
}

int vitd_wait_response(vitd_client* client, vitd_message_callback callback, void* context, int* response) {
  if (client == nullptr) return VITD_ERROR_INVALID_ARGUMENT;
  return Guarded(
      [&]() -> int {
        for (;;) {
          vitd_message seen;
          const int status = ReceiveOne(client, callback, context, &seen);
          if (seen.kind == VITD_MESSAGE_RESPONSE && response != nullptr) *response = seen.response;
          if (status != VITD_OK) return status;
          if (seen.kind == VITD_MESSAGE_RESPONSE) return VITD_OK;
        }
      },
      VITD_ERROR_NO_MEMORY);
}

int vitd_call(vitd_client* client, const char* command, const vitd_value* parameter, vitd_message_callback callback,
              void* context, int* response) {
  const int sent = vitd_send(client, command, parameter);
  if (sent != VITD_OK) return sent;
  return vitd_wait_response(client, callback, context, response);
}

}  // extern "C"
