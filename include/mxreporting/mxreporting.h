/* libmxreporting: the client side of the Harmonia audio reporting daemon,
 * mxreportingd.
 *
 * An audio component opens a client (one connection to the daemon's socket), opens
 * reporting sessions on it, each named by a 64-bit reporter ID, and sends reports: a
 * payload of keys and values with a 32-bit category and a 16-bit type. Every
 * function is safe to call from any thread. Functions return 0 or more on success
 * and a negative errno value on failure (mxr_strerror() says what each means here);
 * functions that allocate what they hand back say who frees it.
 *
 * Sessions live as long as the connection that opened them. When the connection
 * breaks (the daemon restarted, was upgraded, or was started anew by its socket),
 * the library reconnects by itself, 50 ms after the break and then at doubling
 * intervals up to 5 s, and restores every session it opened as it was (created,
 * service type, configuration, started) before it sends anything else. A call made
 * meanwhile waits for that, up to the client's timeout. Requests that were in flight
 * when the connection broke are sent again once the sessions are restored (so a
 * report the daemon had taken just before the break may be taken twice), or fail
 * with -ETIMEDOUT or -ENOTCONN: none is dropped silently. A connection that breaks as soon as it is
 * made is retried ever more slowly, up to 5 s, and said once. While the daemon is
 * away, what waits is bounded: real-time reports stay in their ring (full: dropped
 * and counted), asynchronous sends up to 4096 requests or 16 MiB (past it: -EAGAIN,
 * counted). What a restart costs is
 * the daemon's own: the aggregation of every session's interrupted period (the
 * summary its stop would have sent) is lost with the daemon that held it, and a
 * restored session starts a new period.
 *
 * Build with: cc app.c $(pkg-config --cflags --libs mxreporting)
 */
#ifndef MXREPORTING_MXREPORTING_H
#define MXREPORTING_MXREPORTING_H

#include <stddef.h>
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

typedef struct mxr_client mxr_client;
typedef struct mxr_payload mxr_payload;

/* Errors of the library's own, besides the errno values of the system calls it makes
 * (from mxr_client_open: -ECONNREFUSED or -ENOENT, nobody listens on the socket;
 * -EACCES, this user may not use it, not being in the daemon's group):
 *   -EINVAL     an argument is wrong (NULL where something is needed, a key that is
 *               no text, JSON that does not parse, a payload nested deeper than the
 *               daemon reads: 62 levels, the payload and its innermost values counted),
 *               or the daemon refused the request as one it cannot take; a request
 *               the daemon would refuse is never sent;
 *   -ENAMETOOLONG mxr_client_open(): the socket path is longer than a Unix socket
 *               address holds (107 bytes);
 *   -EMFILE     mxr_session_create(): the daemon holds as many sessions as it takes
 *               (4096 a connection, 16384 in all); none was made;
 *   -E2BIG      mxr_send(): more reporter IDs than one message may name (4096);
 *               nothing was sent;
 *   -ENOSPC     mxr_send(): a session it reaches keeps as much of its period as it
 *               may (64 MiB a session, 512 MiB in all); nothing was sent;
 *   -ENOMEM     out of memory;
 *   -ETIMEDOUT  no reply within the client's timeout;
 *   -ENOTCONN   the client is closing, or a request in flight could not be sent again
 *               before the connection was restored;
 *   -EPROTO     a reply of the wrong shape;
 *   -EPERM      mxr_send(): reporting is switched off on this host (the daemon's
 *               refusal), nothing was sent;
 *   -EAGAIN     mxr_send_rt(): the ring is full; mxr_send_async(): asynchronous sends
 *               already hold all they may; the report was dropped and counted;
 *   -EMSGSIZE   mxr_send_rt(): the report does not fit in a ring slot; any request:
 *               larger than the daemon reads (1 MiB encoded), never sent;
 *   -EDEADLK    a synchronous call from the library's own thread (a callback of
 *               mxr_send_async()), where its reply could never come. */

/* Opens a client on `socket_path`, or, for NULL, on the daemon's socket:
 * $MXREPORTING_ROOT/run/harmonia/reporting.sock ($MXREPORTING_ROOT defaults to /).
 * Fails at once, with a negative errno, when the socket cannot be reached. */
int mxr_client_open(mxr_client **ret, const char *socket_path);
/* Closes the client: its sessions end with the connection. NULL is fine. */
void mxr_client_close(mxr_client *c);
/* How long a synchronous call waits for its reply; 10 s by default. */
int mxr_client_set_timeout(mxr_client *c, uint64_t usec);
/* What an error code returned by this library means: a static text. */
const char *mxr_strerror(int error);

/* A payload: keys (texts) with their values, in the order they were added; adding a
 * key again replaces its value. */
mxr_payload *mxr_payload_new(void);
void mxr_payload_free(mxr_payload *p);
int mxr_payload_add_int(mxr_payload *p, const char *key, int64_t value);
int mxr_payload_add_double(mxr_payload *p, const char *key, double value);
int mxr_payload_add_string(mxr_payload *p, const char *key, const char *value);
int mxr_payload_add_bool(mxr_payload *p, const char *key, int value);
/* Any JSON value, nested arrays and objects included; -EINVAL when it does not parse. */
int mxr_payload_add_json(mxr_payload *p, const char *key, const char *json);

/* Sessions. Each call waits for the daemon's reply. A session belongs to the client
 * that created it; creating an ID again replaces the session. */
int mxr_session_create(mxr_client *c, int64_t reporter_id);
/* The service type by number: 7 long-form audio, 2 telephony, 4 alarms, 12 API
 * usage, ... (the daemon's vocabulary; mxreport help lists them). */
int mxr_session_set_service_type(mxr_client *c, int64_t reporter_id, uint16_t service_type);
/* Merged into the session's configuration ("HostApplicationDisplayID", ...). */
int mxr_session_set_configuration(mxr_client *c, int64_t reporter_id, const mxr_payload *configuration);
/* Starts a reporting period. The daemon answers a start only when the session is
 * stopped: that held reply is the library's to keep, and this returns once the start
 * is on its way. */
int mxr_session_start(mxr_client *c, int64_t reporter_id);
/* Ends the period: the daemon sends the session's summary. */
int mxr_session_stop(mxr_client *c, int64_t reporter_id);
int mxr_session_destroy(mxr_client *c, int64_t reporter_id);

/* Waits for the reply. 0: taken. -EPERM: reporting is switched off (the daemon's
   refusal). reporter_ids NULL: no ID list (every started session, or one standalone
   message). */
int mxr_send(mxr_client *c, const mxr_payload *p, uint32_t category, uint16_t type, const int64_t *reporter_ids,
             size_t n_reporter_ids);

/* The same without waiting: `done`, when given, is called once with what mxr_send()
 * would have returned, on the library's thread (never call a synchronous function of
 * the same client from it). Returns 0 once the report is on its way; -EAGAIN, with
 * `done` never called, when asynchronous sends already hold 4096 requests or 16 MiB
 * (mxr_client_get_async_dropped() counts them), -EMSGSIZE or -EINVAL when the daemon
 * would refuse it. */
typedef void (*mxr_send_done)(int result, void *userdata);
int mxr_send_async(mxr_client *c, const mxr_payload *p, uint32_t category, uint16_t type,
                   const int64_t *reporter_ids, size_t n_reporter_ids, mxr_send_done done, void *userdata);

/* For real-time threads: never blocks, never allocates, takes no lock; at most one
   write(2) to an eventfd. The report is copied into a ring made at mxr_client_open
   and sent by the library's own thread. -EAGAIN: the ring is full (counted and
   dropped); -EMSGSIZE: larger than a ring slot. */
typedef enum mxr_field_kind { MXR_INT, MXR_DOUBLE, MXR_STRING, MXR_BOOL } mxr_field_kind;
typedef struct mxr_field {
    const char *key;
    mxr_field_kind kind;
    union {
        int64_t i;
        double d;
        const char *s;
        int b;
    } value;
} mxr_field;
/* A reporter ID of 0 sends without an ID list, as mxr_send() with NULL does (0 names
 * no session anywhere in the protocol): to every started session, or alone. The
 * ring holds MXR_RT_SLOTS reports of at most MXR_RT_SLOT_BYTES each, encoded: keys
 * and string values with a few bytes each beside them. What the daemon answers is
 * counted, not reported: see mxr_client_get_rt_counts(). */
#define MXR_RT_SLOTS 512
#define MXR_RT_SLOT_BYTES 1024
int mxr_send_rt(mxr_client *c, int64_t reporter_id, uint32_t category, uint16_t type, const mxr_field *fields,
                size_t n_fields);
/* Real-time reports so far: sent (taken by the daemon), dropped (ring full), failed
 * (refused or lost). Any pointer may be NULL. */
int mxr_client_get_rt_counts(mxr_client *c, uint64_t *ret_sent, uint64_t *ret_dropped, uint64_t *ret_failed);
/* Asynchronous sends refused with -EAGAIN so far. */
int mxr_client_get_async_dropped(mxr_client *c, uint64_t *ret_dropped);

/* Questions to the daemon, answered as it sees every client's sessions. */
/* The service type of the session of that ID (65535 when there is none). */
int mxr_session_get_service_type(mxr_client *c, int64_t reporter_id, uint16_t *ret_service_type);
/* 1 when a session of that ID exists in any client, with its service type; 0 (and
 * 65535) when none does. ret_service_type may be NULL. */
int mxr_session_is_valid(mxr_client *c, int64_t reporter_id, uint16_t *ret_service_type);
/* The reporter IDs of every session of every client. *ret_ids is the caller's to
 * free(). */
int mxr_get_reporters(mxr_client *c, int64_t **ret_ids, size_t *ret_n_ids);
/* The daemon's status view (version, clients, stores, exporters) as JSON text, the
 * caller's to free(). */
int mxr_get_status(mxr_client *c, char **ret_json);
/* Ends the daemon at once (it exits with status 2 and answers nothing): 0 once the
 * request is on its way. */
int mxr_kill_service(mxr_client *c);

/* The block throttle: a per-key debounce. A message's delivery is held for its
 * throttle time (its "_throttle_seconds", 0.5 s by default, below 5) and then run on
 * the throttle's own thread; a later message with the same key (its keys and values
 * but for the time-like ones, its reporter, category and type) replaces the held one
 * and its wait starts again, so a burst delivers its last message once. */
typedef struct mxr_throttle mxr_throttle;
typedef void (*mxr_throttle_deliver)(void *userdata);
typedef void (*mxr_throttle_release)(void *userdata);
int mxr_throttle_new(mxr_throttle **ret);
/* Holds `deliver(userdata)` for `message`. `release(userdata)`, when given, is called
 * exactly once, when the throttle is done with `userdata`: after its delivery ran,
 * when it was replaced or dropped, or before this returns a failure. Deliveries run
 * one at a time, on the throttle's thread. */
int mxr_throttle_submit(mxr_throttle *t, int64_t reporter_id, const mxr_payload *message, uint32_t category,
                        uint16_t type, mxr_throttle_deliver deliver, mxr_throttle_release release, void *userdata);
/* Waits, at most 5 s, until every held delivery has run: 0, or how many are still
 * held. */
int mxr_throttle_wait(mxr_throttle *t);
/* Ends the throttle: held deliveries are dropped (and released), and it returns once
 * a delivery still running has ended. NULL is fine. */
void mxr_throttle_free(mxr_throttle *t);
/* The key under which the throttle holds `message`, the caller's to free(), and its
 * throttle time in seconds: for seeing why two messages fold together, or not. */
int mxr_throttle_describe(const mxr_payload *message, int64_t reporter_id, uint32_t category, uint16_t type,
                          char **ret_key, double *ret_seconds);

/* Where the library's own diagnostics go (the throttle's lines among them): `log` is
 * called with a syslog priority (LOG_DEBUG to LOG_ERR) and one line of text, on the
 * thread that wrote it. NULL, the default: lines of LOG_NOTICE and above go to
 * standard error. For the whole process. */
typedef void (*mxr_log_function)(int priority, const char *line, void *userdata);
void mxr_set_log_function(mxr_log_function log, void *userdata);

#ifdef __cplusplus
}
#endif

#endif
