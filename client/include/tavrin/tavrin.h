/* tavrin.h: the C interface of libtavrin, for C programs and other languages' foreign function
 * interfaces, with a send that is safe on an audio thread.
 *
 * A tavrin_client is one connection to the tavrin service. Its session operations (create,
 * start, stop, destroy) wait for the service and may block: call them from an ordinary thread.
 * tavrin_send_rt() is for the audio thread: it copies the message into a queue preallocated by
 * tavrin_open() and returns. It never blocks, never takes a lock and never allocates; a
 * background thread of the client encodes and sends what it queued. When the queue is full, or
 * the service is unreachable, messages are dropped and counted (tavrin_rt_dropped()).
 *
 * tavrin_send_rt() may be called by one thread at a time per client (one audio thread); give each
 * further real-time thread its own client. The other functions are thread-safe.
 *
 * When the service restarts, the background thread reconnects (every half second while it cannot)
 * and creates, types, configures and starts again the sessions this client had open; messages
 * queued while the service was away are dropped and counted.
 */
#ifndef TAVRIN_TAVRIN_H
#define TAVRIN_TAVRIN_H

#include <stddef.h>
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

/* Bounds of one real-time message: longer keys and strings are cut to fit, more fields or
 * reporter IDs make the send fail with TAVRIN_ERR_TOO_LARGE. */
#define TAVRIN_RT_MAX_FIELDS 16
#define TAVRIN_RT_MAX_KEY 31
#define TAVRIN_RT_MAX_STRING 63
#define TAVRIN_RT_MAX_REPORTERS 8

typedef enum tavrin_status {
  TAVRIN_OK = 0,
  TAVRIN_ERR_NOT_RUNNING = 1,     /* nothing listens on the socket */
  TAVRIN_ERR_PERMISSION = 2,      /* this user may not connect to the socket */
  TAVRIN_ERR_CONNECTION_LOST = 3, /* the service went away */
  TAVRIN_ERR_TIMED_OUT = 4,       /* the service did not answer in time */
  TAVRIN_ERR_REFUSED = 5,         /* the service answered with an error */
  TAVRIN_ERR_INVALID = 6,         /* a bad argument (null pointer, bad JSON, zero capacity) */
  TAVRIN_ERR_TOO_LARGE = 7,       /* more fields or reporter IDs than one message may hold */
  TAVRIN_ERR_QUEUE_FULL = 8       /* the real-time queue is full: the message was dropped */
} tavrin_status;

typedef enum tavrin_field_kind {
  TAVRIN_FIELD_INT = 0,
  TAVRIN_FIELD_DOUBLE = 1,
  TAVRIN_FIELD_BOOL = 2,
  TAVRIN_FIELD_STRING = 3
} tavrin_field_kind;

/* One key and value of a real-time message. Strings are copied by tavrin_send_rt(). */
typedef struct tavrin_field {
  const char* key;
  tavrin_field_kind kind;
  union {
    int64_t i;
    double d;
    int b;
    const char* s;
  } value;
} tavrin_field;

typedef struct tavrin_client tavrin_client;

/* Connects to `socket_path` (NULL: TAVRIN_SOCKET, else /run/tavrin/reporting.sock) and
 * preallocates a real-time queue of `rt_capacity` messages. Returns NULL, with *status set when
 * `status` is not NULL, when it cannot connect. */
tavrin_client* tavrin_open(const char* socket_path, size_t rt_capacity, tavrin_status* status);
/* Stops the background thread (what is queued is sent first, as far as the service takes it),
 * ends the sessions of this client and frees it. NULL is ignored. */
void tavrin_close(tavrin_client* client);

/* Creates the session `reporter_id` with a service type and a configuration (a JSON object text,
 * or NULL for none). */
tavrin_status tavrin_create_session(tavrin_client* client, int64_t reporter_id,
                                    uint16_t service_type, const char* configuration_json);
/* Starts it; returns once the service has taken the request (the service answers a start only
 * at the stop). */
tavrin_status tavrin_start_session(tavrin_client* client, int64_t reporter_id);
/* Stops it, once the real-time messages queued before the call have been handed to the service
 * (or dropped), so that they are part of the session. */
tavrin_status tavrin_stop_session(tavrin_client* client, int64_t reporter_id);
tavrin_status tavrin_destroy_session(tavrin_client* client, int64_t reporter_id);

/* Queues a message of `field_count` fields for the sessions `reporter_ids` (none: every running
 * session), with a category and a type. Wait-free and allocation-free: TAVRIN_OK when queued,
 * TAVRIN_ERR_QUEUE_FULL when dropped (and counted), TAVRIN_ERR_TOO_LARGE or TAVRIN_ERR_INVALID
 * when refused (and counted). */
tavrin_status tavrin_send_rt(tavrin_client* client, const int64_t* reporter_ids,
                             size_t reporter_count, uint32_t category, uint16_t type,
                             const tavrin_field* fields, size_t field_count);

/* Real-time messages lost so far: refused, found the queue full, or could not be sent. */
uint64_t tavrin_rt_dropped(const tavrin_client* client);
/* Real-time messages handed to the service so far. */
uint64_t tavrin_rt_sent(const tavrin_client* client);

#ifdef __cplusplus
}
#endif

#endif /* TAVRIN_TAVRIN_H */
