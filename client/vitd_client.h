/*
 * libvitdclient: the C client of the demo-mode helper.
 *
 * A client connects to the helper's Unix socket, sends a request (one
 * command and its parameter) and receives the messages the helper sends
 * back: {"Progress": percent} while a command runs, {"Data": bytes} for
 * commands that return data, and {"Response": true|false} when it ends.
 *
 * The helper answers only a client whose executable carries its
 * entitlement (embed it with the CMake function vitd_embed_entitlements) and
 * is a root-owned file that group and others cannot write. A client that is
 * not entitled gets no answer at all: its requests end in VITD_ERROR_TIMEOUT
 * or VITD_ERROR_CLOSED.
 *
 *     vitd_client *client;
 *     int status = vitd_connect(NULL, &client);
 *     if (status != VITD_OK) { fprintf(stderr, "%s\n", vitd_strerror(status)); ... }
 *     vitd_value *path = vitd_string("/private/var/demo");
 *     int response;
 *     status = vitd_call(client, "prepareWorkContainer", path, on_message, NULL, &response);
 *     vitd_value_free(path);
 *     vitd_disconnect(client);
 *
 * Functions return VITD_OK (0) or a negative vitd_status. A client is used by
 * one thread at a time; different clients are independent. Values are built
 * by the caller and freed with vitd_value_free; a container takes ownership
 * of the items added to it.
 */
#ifndef VITD_CLIENT_H_
#define VITD_CLIENT_H_

#include <stddef.h>
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

#define VITD_CLIENT_VERSION_MAJOR 1

/* Where the helper listens unless told otherwise. */
#define VITD_HELPER_SOCKET "/run/com.orvane.vitrelldhelper.sock"

/* How long a call waits for the next message by default, in milliseconds. */
#define VITD_DEFAULT_TIMEOUT_MS 60000

typedef enum vitd_status {
  VITD_OK = 0,
  VITD_ERROR_INVALID_ARGUMENT = -1, /* a NULL where an object is needed, a request that is no dictionary, ... */
  VITD_ERROR_CONNECT = -2,          /* nothing listens at the socket, or it cannot be reached */
  VITD_ERROR_SEND = -3,             /* the request could not be written (the helper went away) */
  VITD_ERROR_TIMEOUT = -4,          /* no message came within the timeout; the client stays usable */
  VITD_ERROR_CLOSED = -5,           /* the helper closed the connection */
  VITD_ERROR_PROTOCOL = -6,         /* the helper sent a frame that breaks the protocol; the client is spent */
  VITD_ERROR_NO_MEMORY = -7,
  VITD_ERROR_STOPPED = -8,          /* the message callback asked to stop */
  VITD_ERROR_BAD_JSON = -9,         /* text given to vitd_value_from_json is not JSON */
  VITD_ERROR_TOO_LARGE = -10        /* the helper sent a frame over the limits below; the client is spent */
} vitd_status;

/* The limits on what a client receives, the same the helper keeps for what
 * it receives: a frame body holds at most VITD_MAX_FRAME_BYTES, and a frame
 * is decoded only when its objects take at most VITD_MAX_DECODE_FACTOR times
 * its size in memory (a floor of 64 KiB for small frames). The library sums
 * that cost while the bytes arrive, before it builds a single object, so
 * whatever a peer sends, receiving one message costs the client at most the
 * frame plus that multiple of it; a frame over either limit ends the call
 * with VITD_ERROR_TOO_LARGE. */
#define VITD_MAX_FRAME_BYTES (16u << 20)
#define VITD_MAX_DECODE_FACTOR 4

/* A sentence describing status (a static string; never NULL). */
const char *vitd_strerror(int status);

/* ---- Values: what requests and messages are made of ---- */

typedef struct vitd_value vitd_value;

typedef enum vitd_type {
  VITD_TYPE_NULL,
  VITD_TYPE_BOOL,
  VITD_TYPE_INT64,
  VITD_TYPE_UINT64,
  VITD_TYPE_DOUBLE,
  VITD_TYPE_DATE, /* nanoseconds since 1970-01-01 00:00:00 UTC */
  VITD_TYPE_DATA,
  VITD_TYPE_STRING,
  VITD_TYPE_UUID,
  VITD_TYPE_ARRAY,
  VITD_TYPE_DICTIONARY
} vitd_type;

/* Each returns a new value, or NULL when memory runs out (or, for
 * vitd_string, when text is NULL). */
vitd_value *vitd_null(void);
vitd_value *vitd_bool(int value);
vitd_value *vitd_int64(int64_t value);
vitd_value *vitd_uint64(uint64_t value);
vitd_value *vitd_double(double value);
vitd_value *vitd_date(int64_t nanoseconds_since_1970);
vitd_value *vitd_data(const void *bytes, size_t size);
vitd_value *vitd_string(const char *text);
vitd_value *vitd_array(void);
vitd_value *vitd_dictionary(void);

/* Appends item to array / sets key to item in dictionary (a key already there
 * gets the new value). The container takes item over in every case, also
 * when the call fails: the caller must not use or free it afterwards. */
int vitd_array_append(vitd_value *array, vitd_value *item);
int vitd_dictionary_set(vitd_value *dictionary, const char *key, vitd_value *item);

/* Parses JSON text into a value: objects become dictionaries, integers
 * int64 (uint64 above INT64_MAX), other numbers doubles, null null. Nesting
 * deeper than 64 levels is refused. */
int vitd_value_from_json(const char *json, vitd_value **value);

vitd_type vitd_value_type(const vitd_value *value);
/* Number of items of an array or entries of a dictionary; 0 otherwise. */
size_t vitd_value_count(const vitd_value *value);

/* The key of entry index of a dictionary, in the order the entries were
 * added (for a received message: the order on the wire); NULL when value is
 * no dictionary or index is past its end. Valid while value lives unchanged. */
const char *vitd_dictionary_key(const vitd_value *value, size_t index);

/* The value as one line of JSON: data and UUIDs in base64, dates as
 * nanoseconds since 1970, bytes that are not UTF-8 replaced by U+FFFD.
 * Release with free(); NULL when memory runs out. */
char *vitd_value_to_json(const vitd_value *value);

void vitd_value_free(vitd_value *value);

/* ---- Connection ---- */

typedef struct vitd_client vitd_client;

/* Connects to the helper at socket_path (NULL: VITD_HELPER_SOCKET). On
 * success *client is set; release it with vitd_disconnect. */
int vitd_connect(const char *socket_path, vitd_client **client);
void vitd_disconnect(vitd_client *client);

/* How long to wait for each next message (each message restarts the wait);
 * milliseconds > 0. */
int vitd_set_timeout(vitd_client *client, int milliseconds);

/* Sends {"command:": parameter}. command is the request's name, with or
 * without its trailing colon ("prepareWorkContainer"); a NULL parameter is
 * sent as true, which is what commands without a parameter take. The
 * parameter stays the caller's. */
int vitd_send(vitd_client *client, const char *command, const vitd_value *parameter);

/* Sends a whole request dictionary as it is (several commands in one
 * request are answered one "Response" each, in the order of their keys). */
int vitd_send_request(vitd_client *client, const vitd_value *request);

/* ---- Messages ---- */

typedef enum vitd_message_kind {
  VITD_MESSAGE_RESPONSE, /* response holds the outcome */
  VITD_MESSAGE_PROGRESS, /* progress holds the percentage */
  VITD_MESSAGE_DATA,     /* data and data_size hold the bytes */
  VITD_MESSAGE_OTHER     /* anything else; see object */
} vitd_message_kind;

typedef struct vitd_message {
  vitd_message_kind kind;
  int response;             /* VITD_MESSAGE_RESPONSE: 1 true, 0 false */
  int64_t progress;         /* VITD_MESSAGE_PROGRESS */
  const uint8_t *data;      /* VITD_MESSAGE_DATA */
  size_t data_size;
  const vitd_value *object; /* the whole message dictionary, for every kind */
} vitd_message;

/* Called for each message; everything it points to lives until the callback
 * returns. Return 0 to go on, non-zero to stop (the call then returns
 * VITD_ERROR_STOPPED). */
typedef int (*vitd_message_callback)(const vitd_message *message, void *context);

/* Waits for the next message and hands it to callback (which may be NULL). */
int vitd_receive(vitd_client *client, vitd_message_callback callback, void *context);

/* Receives messages, handing each to callback, until a "Response" comes;
 * *response (may be NULL) is then 1 for true and 0 for false. */
int vitd_wait_response(vitd_client *client, vitd_message_callback callback, void *context, int *response);

/* vitd_send, then vitd_wait_response: one command from request to outcome.
 * VITD_OK means the helper answered; *response tells its answer. */
int vitd_call(vitd_client *client, const char *command, const vitd_value *parameter,
              vitd_message_callback callback, void *context, int *response);

#ifdef __cplusplus
}
#endif

#endif /* VITD_CLIENT_H_ */
