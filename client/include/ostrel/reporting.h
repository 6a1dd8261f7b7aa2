/* The client library of the reporting service, for C.
 *
 *     ostrel_client *client = ostrel_client_create(NULL);
 *     ostrel_create_session(client, 4711, NULL, NULL);
 *     ostrel_start_session(client, 4711, NULL, NULL);
 *     ostrel_message *message = ostrel_message_create();
 *     ostrel_message_set_text(message, "route", "Speaker");
 *     int64_t session = 4711;
 *     ostrel_send_message(client, message, 0x40000007, 0, &session, 1, NULL, NULL);
 *     ostrel_message_destroy(message);
 *     ostrel_client_destroy(client);
 *
 * Nothing here waits for the service or raises a signal. Functions that return a
 * pointer return NULL when there is no memory; NULL handles are ignored. Texts are
 * UTF-8 and are copied.
 */
#ifndef OSTREL_REPORTING_H
#define OSTREL_REPORTING_H

#include <stdbool.h>
#include <stddef.h>
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

#define OSTREL_REPORTING_PUBLIC __attribute__((visibility("default")))

typedef struct ostrel_client ostrel_client;
typedef struct ostrel_message ostrel_message;
typedef struct ostrel_list ostrel_list;
typedef struct ostrel_prepared_message ostrel_prepared_message;
typedef struct ostrel_audio_sender ostrel_audio_sender;

/** How a request ended. */
typedef enum ostrel_status {
  OSTREL_REPLIED = 0,
  OSTREL_REFUSED = 1,         /* The service answered with an error. */
  OSTREL_TIMED_OUT = 2,       /* No reply within the request's time. */
  OSTREL_CONNECTION_LOST = 3, /* The service went away. */
  OSTREL_CLOSED = 4           /* The client was closed first. */
} ostrel_status;

/** What became of a call. A request that is not queued is never answered. */
typedef enum ostrel_submission {
  OSTREL_QUEUED = 0,
  OSTREL_QUEUE_FULL = 1,
  OSTREL_INVALID = 2, /* Not UTF-8, too large, nested too deeply, or NULL. */
  OSTREL_CLIENT_CLOSED = 3,
  OSTREL_NO_MEMORY = 4
} ostrel_submission;

/** What the service said of an error; NULL when it said none. Valid during the call. */
typedef struct ostrel_error {
  const char* domain;
  int64_t code;
  const char* description;
} ostrel_error;

/* Replies come on the client's own thread, one at a time, and should not wait. Each
 * request with a callback ends exactly once; a start is answered again at each stop
 * of its session, and a question for the type of ID 0 twice. A NULL callback asks for
 * no reply. Values count when the status is OSTREL_REPLIED. */
typedef void (*ostrel_bool_reply)(void* context, ostrel_status status, bool value);
typedef void (*ostrel_service_type_reply)(void* context, ostrel_status status,
                                          uint16_t service_type);
typedef void (*ostrel_error_reply)(void* context, ostrel_status status,
                                   const ostrel_error* error);
typedef void (*ostrel_valid_reply)(void* context, ostrel_status status,
                                   int64_t reporter_id, uint16_t service_type);
typedef void (*ostrel_reporters_reply)(void* context, ostrel_status status,
                                       const int64_t* reporter_ids, size_t count);

/** Zero means the default of each. */
typedef struct ostrel_options {
  const char* socket_path;   /* Default: the service's own. */
  uint32_t reply_timeout_ms; /* Default 10,000. */
  size_t queue_bytes;        /* Default 8 MiB. */
  bool restore_sessions;     /* Make sessions anew after a loss. */
} ostrel_options;

typedef struct ostrel_counts {
  uint64_t dropped_requests;
  uint64_t timed_out_requests;
  uint64_t connections;
} ostrel_counts;

/** A client that reaches the service in the background, and again whenever it went
 * away. `options` may be NULL. */
OSTREL_REPORTING_PUBLIC ostrel_client* ostrel_client_create(
    const ostrel_options* options);

/** Hands over what waits, for 1 s at most, ends all open requests and frees it. Not
 * from a callback. */
OSTREL_REPORTING_PUBLIC void ostrel_client_destroy(ostrel_client* client);

/** Waits until everything that was queued is handed over; false when it took longer. */
OSTREL_REPORTING_PUBLIC bool ostrel_client_flush(ostrel_client* client,
                                                 uint32_t timeout_ms);
OSTREL_REPORTING_PUBLIC bool ostrel_client_is_connected(const ostrel_client* client);
OSTREL_REPORTING_PUBLIC ostrel_counts ostrel_client_counts(const ostrel_client* client);

/* The operations of the service; any thread. What each does and replies is told in
 * <ostrel/OstrelReportingClient.h>. */
OSTREL_REPORTING_PUBLIC ostrel_submission ostrel_create_session(ostrel_client* client,
                                                                int64_t reporter_id,
                                                                ostrel_bool_reply reply,
                                                                void* context);
OSTREL_REPORTING_PUBLIC ostrel_submission ostrel_set_service_type(ostrel_client* client,
                                                                  uint16_t service_type,
                                                                  int64_t reporter_id,
                                                                  ostrel_bool_reply reply,
                                                                  void* context);
OSTREL_REPORTING_PUBLIC ostrel_submission
ostrel_get_service_type(ostrel_client* client, int64_t reporter_id,
                        ostrel_service_type_reply reply, void* context);
OSTREL_REPORTING_PUBLIC ostrel_submission
ostrel_set_configuration(ostrel_client* client, const ostrel_message* configuration,
                         int64_t reporter_id, ostrel_bool_reply reply, void* context);
OSTREL_REPORTING_PUBLIC ostrel_submission ostrel_start_session(ostrel_client* client,
                                                               int64_t reporter_id,
                                                               ostrel_bool_reply reply,
                                                               void* context);
/** NULL `reporter_ids` is no list (all started sessions); a list may be empty. */
OSTREL_REPORTING_PUBLIC ostrel_submission
ostrel_send_message(ostrel_client* client, const ostrel_message* message,
                    uint32_t category, uint16_t type, const int64_t* reporter_ids,
                    size_t count, ostrel_error_reply reply, void* context);
OSTREL_REPORTING_PUBLIC ostrel_submission ostrel_stop_session(ostrel_client* client,
                                                              int64_t reporter_id,
                                                              ostrel_bool_reply reply,
                                                              void* context);
OSTREL_REPORTING_PUBLIC ostrel_submission ostrel_destroy_session(ostrel_client* client,
                                                                 int64_t reporter_id,
                                                                 ostrel_bool_reply reply,
                                                                 void* context);
OSTREL_REPORTING_PUBLIC ostrel_submission ostrel_reporter_id_valid(
    ostrel_client* client, int64_t reporter_id, ostrel_valid_reply reply, void* context);
OSTREL_REPORTING_PUBLIC ostrel_submission ostrel_get_all_reporters(
    ostrel_client* client, ostrel_reporters_reply reply, void* context);
/** Ends the service process at once. Never replied. */
OSTREL_REPORTING_PUBLIC ostrel_submission ostrel_kill_service(ostrel_client* client);

/* A dictionary in the making. A key that is there already takes the new value. False:
 * there is no memory, or a handle is NULL. Whether it can be sent is said when it is. */
OSTREL_REPORTING_PUBLIC ostrel_message* ostrel_message_create(void);
OSTREL_REPORTING_PUBLIC void ostrel_message_destroy(ostrel_message* message);
OSTREL_REPORTING_PUBLIC bool ostrel_message_set_text(ostrel_message* message,
                                                     const char* key, const char* text);
OSTREL_REPORTING_PUBLIC bool ostrel_message_set_bool(ostrel_message* message,
                                                     const char* key, bool value);
OSTREL_REPORTING_PUBLIC bool ostrel_message_set_int(ostrel_message* message,
                                                    const char* key, int64_t value);
OSTREL_REPORTING_PUBLIC bool ostrel_message_set_uint(ostrel_message* message,
                                                     const char* key, uint64_t value);
OSTREL_REPORTING_PUBLIC bool ostrel_message_set_double(ostrel_message* message,
                                                       const char* key, double value);
/** Microseconds since 1970. */
OSTREL_REPORTING_PUBLIC bool ostrel_message_set_date(ostrel_message* message,
                                                     const char* key,
                                                     int64_t microseconds);
/** A copy of the list or the message. */
OSTREL_REPORTING_PUBLIC bool ostrel_message_set_list(ostrel_message* message,
                                                     const char* key,
                                                     const ostrel_list* list);
OSTREL_REPORTING_PUBLIC bool ostrel_message_set_message(ostrel_message* message,
                                                        const char* key,
                                                        const ostrel_message* value);

OSTREL_REPORTING_PUBLIC ostrel_list* ostrel_list_create(void);
OSTREL_REPORTING_PUBLIC void ostrel_list_destroy(ostrel_list* list);
OSTREL_REPORTING_PUBLIC bool ostrel_list_append_text(ostrel_list* list, const char* text);
OSTREL_REPORTING_PUBLIC bool ostrel_list_append_bool(ostrel_list* list, bool value);
OSTREL_REPORTING_PUBLIC bool ostrel_list_append_int(ostrel_list* list, int64_t value);
OSTREL_REPORTING_PUBLIC bool ostrel_list_append_uint(ostrel_list* list, uint64_t value);
OSTREL_REPORTING_PUBLIC bool ostrel_list_append_double(ostrel_list* list, double value);
OSTREL_REPORTING_PUBLIC bool ostrel_list_append_list(ostrel_list* list,
                                                     const ostrel_list* value);
OSTREL_REPORTING_PUBLIC bool ostrel_list_append_message(ostrel_list* list,
                                                        const ostrel_message* value);

/** A message laid out once, for audio threads; used by one thread at a time. NULL too
 * when it could never be sent. */
OSTREL_REPORTING_PUBLIC ostrel_prepared_message* ostrel_prepared_message_create(
    const ostrel_message* message, uint32_t category, uint16_t type,
    const int64_t* reporter_ids, size_t count);
OSTREL_REPORTING_PUBLIC void ostrel_prepared_message_destroy(
    ostrel_prepared_message* message);
/** A place whose number can be changed; -1 when there is no number at `key`. Allocates.
 */
OSTREL_REPORTING_PUBLIC int ostrel_prepared_message_field(
    ostrel_prepared_message* message, const char* key);
/* Audio threads: no lock, no system call, no allocation. */
OSTREL_REPORTING_PUBLIC void ostrel_prepared_message_set_int(
    ostrel_prepared_message* message, int field, int64_t value);
OSTREL_REPORTING_PUBLIC void ostrel_prepared_message_set_double(
    ostrel_prepared_message* message, int field, double value);

/** The way in for one audio thread, armed. See <ostrel/AudioSender.h>. Destroyed before
 * its client. */
OSTREL_REPORTING_PUBLIC ostrel_audio_sender* ostrel_audio_sender_create(
    ostrel_client* client, size_t ring_bytes, uint32_t period_us);
OSTREL_REPORTING_PUBLIC void ostrel_audio_sender_destroy(ostrel_audio_sender* sender);
/** Audio threads: no lock, no system call, no allocation. False: dropped and counted. */
OSTREL_REPORTING_PUBLIC bool ostrel_audio_sender_send(
    ostrel_audio_sender* sender, const ostrel_prepared_message* message);
OSTREL_REPORTING_PUBLIC uint64_t
ostrel_audio_sender_dropped(const ostrel_audio_sender* sender);
OSTREL_REPORTING_PUBLIC void ostrel_audio_sender_arm(ostrel_audio_sender* sender);
OSTREL_REPORTING_PUBLIC void ostrel_audio_sender_disarm(ostrel_audio_sender* sender);

#ifdef __cplusplus
}
#endif

#endif
