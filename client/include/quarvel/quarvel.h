#ifndef QUARVEL_QUARVEL_H
#define QUARVEL_QUARVEL_H

/* The client library of the audio reporting service, for C. <quarvel/client.hpp> is the same for
 * C++: same operations, same rules.
 *
 * Conventions. Texts are UTF-8 and end with a zero byte. A function that can fail returns
 * QUARVEL_OK or the reason. The caller owns every opaque object that a function returns, and frees
 * it with the `_free` function of its kind, which accepts NULL. Arguments are used only during the
 * call. No C++ exception leaves the library; a callback must throw none into it. */

/* NOLINTBEGIN(modernize-deprecated-headers,modernize-use-using): this is C. */

#include <stdbool.h>
#include <stddef.h>
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

/* ---- Errors */

typedef enum quarvel_status {
  QUARVEL_OK = 0,
  QUARVEL_UNREACHABLE = 1,      /* the service is not running, or may not be used: see the reason */
  QUARVEL_CONNECTION_LOST = 2,  /* the call may or may not have been carried out */
  QUARVEL_TIMED_OUT = 3,        /* a synchronous call waited for its whole time-out */
  QUARVEL_WOULD_DEADLOCK = 4,   /* a synchronous call, or quarvel_dispatch, from a callback */
  QUARVEL_UNEXPECTED_REPLY = 5, /* of another kind than the operation's */
  QUARVEL_HELD_BACK = 6,        /* too much has gathered: try again later */
  QUARVEL_DEFERRED = 7,  /* takes effect after the reconnection: see quarvel_options.reconnect */
  QUARVEL_REFUSED = 100, /* by the service: see the error's domain and code */
  QUARVEL_INVALID_ARGUMENT = 101, /* a pointer that must not be NULL is, or a size is too small */
  QUARVEL_INVALID_PAYLOAD = 102,  /* see quarvel_payload_status */
  QUARVEL_NO_MEMORY = 103         /* or another resource of the process */
} quarvel_status;

/* The meaning of a status, a sentence; never NULL, valid for ever. */
const char* quarvel_status_text(quarvel_status status);

/* The reason of a failure. Texts that are too long are cut at the end of a character. */
typedef struct quarvel_error {
  quarvel_status status;
  int64_t code;     /* in the domain */
  char domain[64];  /* "quarvel.client" for a failure on this side; see docs/client.md */
  char reason[448]; /* the fault and the remedy, a sentence; may be empty */
} quarvel_error;

/* ---- Payloads: dictionaries of values, encoded as MessagePack while they are built */

/* One thread at a time. An error stays: after a failed step all later ones fail too, so it is
 * enough to check at the end, or when the payload is sent. */
typedef struct quarvel_payload quarvel_payload;

/* An empty dictionary; NULL when there is no memory. */
quarvel_payload* quarvel_payload_new(void);
void quarvel_payload_free(quarvel_payload* payload);
/* Makes it empty and forgets the error. Keeps the memory, so reuse a payload where you can. */
void quarvel_payload_clear(quarvel_payload* payload);
/* QUARVEL_OK, QUARVEL_NO_MEMORY or QUARVEL_INVALID_PAYLOAD. A payload is invalid with a text that
 * is not UTF-8, a missing or superfluous key, a container that is not closed or not open, or a date
 * out of range. It is invalid too with more than 30 containers in each other (this one included),
 * and with assigned bytes that are no dictionary. */
quarvel_status quarvel_payload_status(const quarvel_payload* payload);

/* Each appends a value: in a dictionary under `key`, in a list with NULL. The last of equal keys
 * counts. */
quarvel_status quarvel_payload_nil(quarvel_payload* payload, const char* key);
quarvel_status quarvel_payload_boolean(quarvel_payload* payload, const char* key, bool value);
quarvel_status quarvel_payload_integer(quarvel_payload* payload, const char* key, int64_t value);
quarvel_status quarvel_payload_unsigned(quarvel_payload* payload, const char* key, uint64_t value);
quarvel_status quarvel_payload_real(quarvel_payload* payload, const char* key, double value);
quarvel_status quarvel_payload_string(quarvel_payload* payload, const char* key, const char* text);
quarvel_status quarvel_payload_bytes(quarvel_payload* payload, const char* key, const void* bytes,
                                     size_t size);
/* Microseconds since 1970-01-01T00:00:00Z, years 1 to 9999. */
quarvel_status quarvel_payload_date(quarvel_payload* payload, const char* key,
                                    int64_t microseconds);
/* Opens a container, which takes the following values until it is closed. */
quarvel_status quarvel_payload_open_dictionary(quarvel_payload* payload, const char* key);
quarvel_status quarvel_payload_open_list(quarvel_payload* payload, const char* key);
quarvel_status quarvel_payload_close(quarvel_payload* payload);
/* The next value of a dictionary stands under this number instead; its `key` is then NULL. */
quarvel_status quarvel_payload_number_key(quarvel_payload* payload, int64_t key);
/* Replaces the contents by a dictionary in encoded form. */
quarvel_status quarvel_payload_assign(quarvel_payload* payload, const void* message_pack,
                                      size_t size);

/* ---- The connection */

/* Every function may be called from every thread, except quarvel_client_free, quarvel_dispatch and,
 * with QUARVEL_CALLER, the synchronous calls: these are for one thread at a time. Calls reach the
 * service in their order. After fork() the child may only free the client, or exec. */
typedef struct quarvel_client quarvel_client;

typedef enum quarvel_driver {
  QUARVEL_OWN_THREAD = 0, /* callbacks come on the connection's own thread */
  QUARVEL_CALLER = 1      /* callbacks come in quarvel_dispatch; the library makes no thread */
} quarvel_driver;

typedef struct quarvel_connection_change {
  bool restored;       /* else it was lost */
  const char* reason;  /* of a loss; else empty */
  uint64_t unanswered; /* loss: pending calls, which are answered with an error next */
  uint64_t unsent;     /* calls without a reply that certainly did not reach the service */
  uint64_t sessions;   /* sessions that will be restored, or have been */
} quarvel_connection_change;

typedef void (*quarvel_connection_changed)(void* context, const quarvel_connection_change* change);

/* Zero is the default of every member but `size`. */
typedef struct quarvel_options {
  size_t size;             /* sizeof(quarvel_options), since the library may be older or newer */
  const char* socket_path; /* NULL: $QUARVEL_SOCKET, else where the service listens by default */
  quarvel_driver driver;
  /* Makes a lost connection again and restores this client's sessions: created with their service
   * type and configuration, and started if they were. The start's reply then reports the end of the
   * new start. Calls about these sessions, made in between or pending at the loss, are answered
   * with QUARVEL_DEFERRED: they take effect when the session is restored. All others are answered
   * with QUARVEL_CONNECTION_LOST. Nothing is sent twice. */
  bool reconnect;
  uint32_t first_delay_ms;   /* before the first attempt; doubles up to the longest. 0: 100 */
  uint32_t longest_delay_ms; /* 0: 30,000 */
  size_t gathered_bytes;     /* bytes that may gather where a call may not wait. 0: 4 MiB */
  quarvel_connection_changed connection_changed;
  void* context; /* of connection_changed */
} quarvel_options;

/* Connects to the service. `options` may be NULL. Errors: QUARVEL_UNREACHABLE,
 * QUARVEL_INVALID_ARGUMENT, QUARVEL_NO_MEMORY; `error`, when not NULL, holds the details. */
quarvel_status quarvel_client_new(const quarvel_options* options, quarvel_client** client,
                                  quarvel_error* error);
/* Sends the gathered calls, for at most five seconds, closes the connection, which stops its
 * sessions, and answers every pending call with QUARVEL_CONNECTION_LOST. A callback may free its
 * client. */
void quarvel_client_free(quarvel_client* client);
bool quarvel_connected(const quarvel_client* client);

/* For QUARVEL_CALLER: a descriptor that is readable while an event is due: input, room for output
 * or a timer. Watch it level- or edge-triggered and call quarvel_dispatch each time. It stays the
 * same through reconnections. The client owns it: stop watching it before the client is freed. -1
 * for QUARVEL_OWN_THREAD. */
int quarvel_descriptor(const quarvel_client* client);
/* Handles the events that are due. Waits for one for at most `timeout_ms`; negative: without limit.
 * QUARVEL_CONNECTION_LOST: lost for good, stop watching. QUARVEL_WOULD_DEADLOCK, without any
 * effect: from a callback, beside another thread's dispatch, or with QUARVEL_OWN_THREAD. */
quarvel_status quarvel_dispatch(quarvel_client* client, int timeout_ms);

/* ---- The operations
 *
 * Each returns at once. A reply that is not NULL is called exactly once, on the thread that drives
 * the connection. Its `error` is NULL, or the reason for which there is no result. A reply may make
 * calls, which never wait. A call without a reply is a notification, which the service never
 * answers. Each function returns QUARVEL_OK, or the reason for which the call was not accepted; the
 * reply receives that too. After QUARVEL_INVALID_ARGUMENT, QUARVEL_INVALID_PAYLOAD and
 * QUARVEL_NO_MEMORY the call has had no effect, and the reply is not called.
 *
 * With QUARVEL_OWN_THREAD a call waits while the service does not read this client's socket. With
 * QUARVEL_CALLER, and from a callback, it is refused with QUARVEL_HELD_BACK when too much has
 * gathered. */

typedef void (*quarvel_done_reply)(void* context, const quarvel_error* error);
typedef void (*quarvel_boolean_reply)(void* context, bool result, const quarvel_error* error);
typedef void (*quarvel_service_type_reply)(void* context, uint16_t service_type,
                                           const quarvel_error* error);
typedef void (*quarvel_valid_reply)(void* context, int64_t reporter_id, uint16_t service_type,
                                    const quarvel_error* error);
typedef void (*quarvel_reporters_reply)(void* context, const int64_t* reporter_ids, size_t count,
                                        const quarvel_error* error);

/* Makes a session under `reporter_id`, which the caller chooses (not 0; all clients share one space
 * of ids); one that this client has there is replaced without being stopped. */
quarvel_status quarvel_create_reporting_session(quarvel_client* client, int64_t reporter_id,
                                                quarvel_boolean_reply reply, void* context);
/* Sets the purpose of the audio of this client's own session. */
quarvel_status quarvel_set_service_type(quarvel_client* client, uint16_t service_type,
                                        int64_t reporting_session, quarvel_boolean_reply reply,
                                        void* context);
/* Fetches the service type's code; QUARVEL_SERVICE_UNKNOWN when there is no such session. */
quarvel_status quarvel_get_service_name_for_reporter_id(quarvel_client* client, int64_t reporter_id,
                                                        quarvel_service_type_reply reply,
                                                        void* context);
/* Merges `configuration` (NULL: nothing) into the user information of this client's own session. */
quarvel_status quarvel_set_configuration(quarvel_client* client,
                                         const quarvel_payload* configuration, int64_t reporter_id,
                                         quarvel_boolean_reply reply, void* context);
/* Starts a session of any client. The reply comes when the session STOPS, perhaps days later. When
 * there is no such session, or it is started already, no reply comes before the connection ends. */
quarvel_status quarvel_start_reporting_session_for_id(quarvel_client* client, int64_t reporter_id,
                                                      quarvel_boolean_reply stopped, void* context);
/* Sends a message to the sessions named, started or not; with `reporting_ids` NULL to every started
 * session of every client, and when there is none, once on its own. The reply reports the routing,
 * not the delivery. */
quarvel_status quarvel_send_message(quarvel_client* client, const quarvel_payload* payload,
                                    uint32_t category, uint16_t type, const int64_t* reporting_ids,
                                    size_t count, quarvel_done_reply reply, void* context);
/* Stops this client's own session. */
quarvel_status quarvel_stop_reporting_session_for_id(quarvel_client* client, int64_t reporter_id,
                                                     quarvel_boolean_reply reply, void* context);
/* Stops this client's own session if need be and forgets it. */
quarvel_status quarvel_destroy_reporting_session(quarvel_client* client, int64_t reporter_id,
                                                 quarvel_boolean_reply reply, void* context);
/* Asks whether any client has such a session; the reply's reporter_id is 0 when none has. */
quarvel_status quarvel_reporter_id(quarvel_client* client, int64_t reporter_id,
                                   quarvel_valid_reply valid, void* context);
/* The ids of every client's sessions, valid for the length of the reply. */
quarvel_status quarvel_get_all_reporters(quarvel_client* client, quarvel_reporters_reply reply,
                                         void* context);
/* Ends the service at once: the reply receives QUARVEL_CONNECTION_LOST, which here is success. */
quarvel_status quarvel_kill_service(quarvel_client* client, quarvel_boolean_reply reply,
                                    void* context);

/* ---- The operations, waiting for their replies
 *
 * Each waits for at most `timeout_ms`; negative: without limit. A later reply is discarded. Results
 * and `error` may be NULL. Not from a callback. With QUARVEL_CALLER they dispatch while
 * they wait. Where the reply is true whether or not there is such a session, there is no result. */

quarvel_status quarvel_sync_create_reporting_session(quarvel_client* client, int64_t reporter_id,
                                                     int timeout_ms, quarvel_error* error);
quarvel_status quarvel_sync_set_service_type(quarvel_client* client, uint16_t service_type,
                                             int64_t reporting_session, int timeout_ms,
                                             quarvel_error* error);
quarvel_status quarvel_sync_get_service_name_for_reporter_id(quarvel_client* client,
                                                             int64_t reporter_id, int timeout_ms,
                                                             uint16_t* service_type,
                                                             quarvel_error* error);
quarvel_status quarvel_sync_set_configuration(quarvel_client* client,
                                              const quarvel_payload* configuration,
                                              int64_t reporter_id, int timeout_ms,
                                              quarvel_error* error);
/* Waits until the start has been carried out, not for its reply. `started`: there is such a
 * session, so it is started, and `stopped` (which may be NULL) is called as in the other form. */
quarvel_status quarvel_sync_start_reporting_session_for_id(quarvel_client* client,
                                                           int64_t reporter_id,
                                                           quarvel_boolean_reply stopped,
                                                           void* context, int timeout_ms,
                                                           bool* started, quarvel_error* error);
quarvel_status quarvel_sync_send_message(quarvel_client* client, const quarvel_payload* payload,
                                         uint32_t category, uint16_t type,
                                         const int64_t* reporting_ids, size_t count, int timeout_ms,
                                         quarvel_error* error);
quarvel_status quarvel_sync_stop_reporting_session_for_id(quarvel_client* client,
                                                          int64_t reporter_id, int timeout_ms,
                                                          quarvel_error* error);
quarvel_status quarvel_sync_destroy_reporting_session(quarvel_client* client, int64_t reporter_id,
                                                      int timeout_ms, quarvel_error* error);
/* `valid`: whether any client has such a session; then `service_type` is its. */
quarvel_status quarvel_sync_reporter_id(quarvel_client* client, int64_t reporter_id, int timeout_ms,
                                        bool* valid, uint16_t* service_type, quarvel_error* error);
/* Fills `reporter_ids` with at most `room` ids and sets `count` to how many there are. */
quarvel_status quarvel_sync_get_all_reporters(quarvel_client* client, int timeout_ms,
                                              int64_t* reporter_ids, size_t room, size_t* count,
                                              quarvel_error* error);
/* QUARVEL_OK when the service has ended. */
quarvel_status quarvel_sync_kill_service(quarvel_client* client, int timeout_ms,
                                         quarvel_error* error);

/* ---- Reporting from a real-time thread */

/* Messages to one session through a ring of fixed-size records, which the thread that drives the
 * client's connection empties. The functions marked RT allocate nothing, take no lock, make no
 * system call and end after a bounded number of steps. They are for one thread at a time, the
 * producer; all others are for other threads. Link the program with -Wl,-z,now, so that the first
 * call does not run the dynamic linker. */
typedef struct quarvel_realtime quarvel_realtime;

typedef struct quarvel_realtime_loss {
  uint64_t full;      /* no free slot */
  uint64_t too_large; /* larger than record_bytes */
  uint64_t invalid;   /* a key or a text was not UTF-8 */
  uint64_t unsent;    /* the connection was lost for good, or the reporter was freed */
} quarvel_realtime_loss;

/* Called with the losses since its last call, on the thread that empties the ring: the client's
 * driver, or the caller of quarvel_realtime_stop or quarvel_realtime_free. Must not use the
 * reporter. */
typedef void (*quarvel_realtime_lost)(void* context, const quarvel_realtime_loss* loss);

/* Zero is the default of every member but `size`. */
typedef struct quarvel_realtime_options {
  size_t size;          /* sizeof(quarvel_realtime_options) */
  size_t records;       /* slots, rounded up to a power of two. 0: 256 */
  size_t record_bytes;  /* of a record's MessagePack. 0: 256 */
  uint32_t interval_ms; /* interval at which the ring is emptied while started. 0: 100 */
  bool no_loss_message; /* no message to the session after a loss */
  quarvel_realtime_lost lost;
  void* context; /* of lost */
} quarvel_realtime_options;

/* `options` may be NULL. NULL when there is no memory, or an argument is invalid. Nothing wakes up
 * before the reporter is started. Free it before its client. */
quarvel_realtime* quarvel_realtime_new(quarvel_client* client, int64_t reporter_id,
                                       const quarvel_realtime_options* options);
/* Stops. */
void quarvel_realtime_free(quarvel_realtime* reporter);
void quarvel_realtime_start(quarvel_realtime* reporter);
/* Empties the ring before it returns. */
void quarvel_realtime_stop(quarvel_realtime* reporter);
/* Since it was made: records handed to the connection, and losses; both may be NULL. */
void quarvel_realtime_statistics(const quarvel_realtime* reporter, uint64_t* sent,
                                 quarvel_realtime_loss* lost);

/* RT. Opens a record, and abandons one that is open; false when the ring is full. */
bool quarvel_realtime_begin(quarvel_realtime* reporter, uint32_t category, uint16_t type);
/* RT. Each adds a value to the open record; without one they do nothing. */
void quarvel_realtime_boolean(quarvel_realtime* reporter, const char* key, bool value);
void quarvel_realtime_integer(quarvel_realtime* reporter, const char* key, int64_t value);
void quarvel_realtime_unsigned(quarvel_realtime* reporter, const char* key, uint64_t value);
void quarvel_realtime_real(quarvel_realtime* reporter, const char* key, double value);
void quarvel_realtime_string(quarvel_realtime* reporter, const char* key, const char* text);
void quarvel_realtime_date(quarvel_realtime* reporter, const char* key, int64_t microseconds);
/* RT. Hands the record over to be sent. False when it is lost, which is counted. */
bool quarvel_realtime_send(quarvel_realtime* reporter);

/* ---- Codes. Others are allowed; the service names them "Undefined" or not at all. */

/* A category is a component, or none, plus a kind. */
#define QUARVEL_COMPONENT_SESSION UINT32_C(0x08000000)
#define QUARVEL_COMPONENT_DSP UINT32_C(0x10000000)
#define QUARVEL_COMPONENT_HAL UINT32_C(0x20000000)
#define QUARVEL_COMPONENT_ROUTING UINT32_C(0x40000000)
#define QUARVEL_COMPONENT_TOOLBOX UINT32_C(0x80000000)

enum {
  QUARVEL_KIND_GENERIC = 1,
  QUARVEL_KIND_RECORD = 2,
  QUARVEL_KIND_PLAYBACK = 3,
  QUARVEL_KIND_PLAYBACK_AND_RECORD = 4,
  QUARVEL_KIND_SETUP = 5,
  QUARVEL_KIND_CLIENT_REQUEST = 6,
  QUARVEL_KIND_ROUTE_CHANGE = 7,
  QUARVEL_KIND_ERROR = 8,
  QUARVEL_KIND_TALLIXING = 9,
  QUARVEL_KIND_PERFORMANCE = 10,
  QUARVEL_KIND_VOLUME = 11
};

enum {
  QUARVEL_TYPE_GENERIC = 0,
  QUARVEL_TYPE_START = 1,
  QUARVEL_TYPE_STOP = 2,
  QUARVEL_TYPE_SETUP = 3,
  QUARVEL_TYPE_ERROR = 4,
  QUARVEL_TYPE_ISSUE_DETECTOR = 5,
  QUARVEL_TYPE_UNKNOWN = 65535
};

enum {
  QUARVEL_SERVICE_GENERIC = 0,
  QUARVEL_SERVICE_KIVO = 1,
  QUARVEL_SERVICE_TELEPHONY = 2,
  QUARVEL_SERVICE_HAPTICS = 3,
  QUARVEL_SERVICE_ALARMS = 4,
  QUARVEL_SERVICE_STANDALONE = 5,
  QUARVEL_SERVICE_SOUND_AUTO_CONFIG = 6,
  QUARVEL_SERVICE_LONG_FORM_AUDIO = 7,
  QUARVEL_SERVICE_NON_LONG_FORM_AUDIO = 8,
  QUARVEL_SERVICE_AUDIO_DEVICE_USAGE = 9,
  QUARVEL_SERVICE_ALERTS = 10,
  QUARVEL_SERVICE_TEST = 11, /* its messages are dropped */
  QUARVEL_SERVICE_UNKNOWN = 65535
};

#ifdef __cplusplus
}
#endif

/* NOLINTEND(modernize-deprecated-headers,modernize-use-using) */

#endif
