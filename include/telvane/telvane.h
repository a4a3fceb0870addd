/*
 * telvane.h: the C interface of the telvane client library (libtelvane.so).
 *
 * A reporting client written in C (or in any language that calls C) opens one
 * session per reporting session with the telvaned daemon, starts it, sends events,
 * flushes, uploads files, updates shared data and runs periodic metrics tasks, just
 * as a C++ client does with telvane::Telvane (telvane/Telvane.h). This header is plain
 * C99 and needs nothing but the C library; link with -ltelvane.
 *
 *     telvane_error* error = NULL;
 *     telvane_session* s = telvane_session_create(
 *         "{\"ComponentType\": 7, \"SessionID\": 1}",
 *         "{\"_clientName\": \"com.example.conference\", \"_serviceName\": \"calls\"}", &error);
 *     if (!s) { fprintf(stderr, "%s\n", telvane_error_message(error)); telvane_error_free(error); return 1; }
 *     telvane_session_start_wait(s, 10000, NULL);
 *     telvane_session_send(s, 12, 1, "{\"codec\": \"opus\", \"jitterMs\": 12.5}", NULL);
 *     telvane_session_flush_wait(s, 10000, NULL);
 *     telvane_session_finish(s);
 *     telvane_session_free(s);
 *
 * Values. Every map or value that crosses this interface (session information, user
 * information, payloads, event maps, shared data, statistics, hierarchy tokens) is
 * JSON text, UTF-8, read in full: a text that is not one well-formed JSON value, or a
 * value of the wrong kind where an object is required, is refused with
 * TELVANE_ERROR_INVALID_ARGUMENT. The keys are those of telvane/TelvaneKeys.h
 * ("ComponentType", "SessionID", "_clientName", "ParametersCategory", ...).
 *
 * Errors. A function that can fail takes a `telvane_error** error` as its last
 * argument, which may be NULL when the caller does not want the details. When it is
 * not NULL, *error is set to NULL on success and to a new error on failure; the
 * caller frees that error with telvane_error_free(). An error has a code, a domain
 * and a message:
 *   - domain "TelvaneErrorDomain" (TELVANE_ERROR_DOMAIN): the library's own refusals,
 *     codes 2 session information missing, 3 component type invalid (only types 5
 *     to 30 report), 4 category 0, 8 the daemon refused the session; the daemon's
 *     refusals of a request carry code -1;
 *   - an event map without its category or type: code 7, and the domain is the
 *     message itself ("Missing mandatory parameter 'category'"), a shape clients of
 *     the library have long relied on;
 *   - domain "TelvaneInterfaceErrorDomain" (TELVANE_INTERFACE_ERROR_DOMAIN): what only
 *     this interface can report, the TELVANE_ERROR_* codes below.
 * No C++ exception ever leaves a function of this header.
 *
 * Threading. Every function may be called from any thread, also on one session from
 * several threads at once, as long as the session is not being freed. Calls to the
 * daemon are made in order, on the session's own serial queue, on the library's
 * worker threads; the client needs no event loop.
 *
 * Callbacks. Every callback gets back the `user_data` pointer given with it. They run
 * on the library's worker threads, never on the caller's thread and never inside
 * the call that registered them:
 *   - completions (start, state fetch, flush, upload) and the message-logging
 *     callback run on the session's serial queue, one at a time, in order; each
 *     completion runs at most once;
 *   - periodic services run on the session's periodic-task queue, up to four of them
 *     at the same time, so a service shared by several modules must be reentrant.
 * A callback returns promptly and must not call telvane_session_free() on its own
 * session, nor any function that waits (the _wait functions,
 * telvane_session_unregister_periodic_task()): those wait for the very queue the
 * callback runs on. Sending, flushing or finishing from a callback is fine.
 *
 * Lifetime. A session is freed with telvane_session_free(), which (as the destructor
 * of telvane::Telvane does) stops the log timer, waits until the calls already made
 * were written to the daemon and, for at most a second, until the daemon answered
 * those that expect a reply; completions whose reply arrived by then have run when it
 * returns, the others are never called (so their user data is the caller's to
 * release). A telvane_session_finish() or a flush issued just before
 * telvane_session_free() still reaches the daemon. A periodic tick in progress gets at
 * most one more second; a service still running after that finishes on its own
 * thread, and its destroy callback runs when it returns. A destroy callback runs on
 * whichever thread lets go of the user data last, possibly inside the call that
 * replaced or refused it. Memory handed to a callback (texts, errors, statistics) is
 * borrowed for the callback's duration only. Texts returned by a function are the
 * caller's and freed with telvane_string_free().
 */
#ifndef TELVANE_TELVANE_H
#define TELVANE_TELVANE_H

#include <stdbool.h>
#include <stddef.h>
#include <stdint.h>

#include "telvane/Export.h"

#ifdef __cplusplus
extern "C" {
#endif

/* ---- Opaque handles ---------------------------------------------------------- */

/* One reporting session with the daemon. */
typedef struct telvane_session telvane_session;
/* An error: code, domain, message and further details. */
typedef struct telvane_error telvane_error;
/* The dictionary a periodic service fills; valid during the service's call only. */
typedef struct telvane_stats telvane_stats;

/* ---- Errors ------------------------------------------------------------------ */

#define TELVANE_ERROR_DOMAIN "TelvaneErrorDomain"
#define TELVANE_ERROR_SESSION_INFO_MISSING 2L
#define TELVANE_ERROR_COMPONENT_TYPE_INVALID 3L
#define TELVANE_ERROR_CATEGORY_ZERO 4L
#define TELVANE_ERROR_MISSING_PARAMETER 7L
#define TELVANE_ERROR_REFUSED_BY_DAEMON 8L

#define TELVANE_INTERFACE_ERROR_DOMAIN "TelvaneInterfaceErrorDomain"
/* A NULL handle or text where one is required, JSON that cannot be read, a value of
 * the wrong kind, or a file that cannot be opened for an upload. */
#define TELVANE_ERROR_INVALID_ARGUMENT 1L
/* No session was made although the session information was accepted: reporting is
 * disabled by "EnableFlag" 0, the process may not use the service, or the daemon
 * cannot be reached. */
#define TELVANE_ERROR_NO_SESSION 2L
/* A _wait function did not get the daemon's answer in time. */
#define TELVANE_ERROR_TIMED_OUT 3L
/* The daemon reported a file upload as failed. */
#define TELVANE_ERROR_UPLOAD_FAILED 4L
/* The library could not do what was asked (out of memory, an unexpected failure). */
#define TELVANE_ERROR_INTERNAL 5L

TELVANE_EXPORT long telvane_error_code(const telvane_error* error);
/* The domain and the message; valid until the error is freed, never NULL for an
 * error (NULL for a NULL error). */
TELVANE_EXPORT const char* telvane_error_domain(const telvane_error* error);
TELVANE_EXPORT const char* telvane_error_message(const telvane_error* error);
/* Further details as JSON text: an object, or "null" when there are none. */
TELVANE_EXPORT const char* telvane_error_user_info_json(const telvane_error* error);
/* A copy the caller frees; NULL for NULL. */
TELVANE_EXPORT telvane_error* telvane_error_copy(const telvane_error* error);
/* Accepts NULL. */
TELVANE_EXPORT void telvane_error_free(telvane_error* error);

/* Frees a text returned by this interface. Accepts NULL. */
TELVANE_EXPORT void telvane_string_free(char* text);

/* The version of the library, for logs ("0.1.0"); a static text. */
TELVANE_EXPORT const char* telvane_version(void);

/* ---- Callback types ---------------------------------------------------------- */

/* Start and state fetch: true when the daemon answered with its configuration of
 * the session (a list of enabled backends). */
typedef void (*telvane_states_callback)(bool configured, void* user_data);
/* Flush: NULL on success, else the daemon's error (borrowed). */
typedef void (*telvane_flush_callback)(const telvane_error* error, void* user_data);
/* File upload: true when the daemon reported the upload as done. */
typedef void (*telvane_upload_callback)(bool succeeded, void* user_data);
/* Log-data upload: the outcome and the daemon's error, or NULL (borrowed). */
typedef void (*telvane_upload_data_callback)(bool succeeded, const telvane_error* error, void* user_data);
/* The daemon's reply texts (borrowed). */
typedef void (*telvane_logging_callback)(const char* text, void* user_data);
/* A periodic service: fills `stats` (a fresh, empty dictionary on every call). On a
 * report tick what it put there is its module's contribution to the realtime event;
 * on an update tick it is discarded. */
typedef void (*telvane_periodic_service)(telvane_stats* stats, void* user_data);
/* Releases a user_data pointer the library no longer needs. */
typedef void (*telvane_destroy_callback)(void* user_data);

/* ---- Sessions ------------------------------------------------------------------ */

/* Makes a session and connects it to the daemon (found at $TELVANED_SOCKET, else at
 * its installed socket). `session_info_json` is an object with at least
 * "ComponentType" (5...30); `user_info_json` an object or NULL. NULL on failure,
 * with the error: TELVANE_ERROR_SESSION_INFO_MISSING (NULL or "null" session
 * information, a value that is not an object), TELVANE_ERROR_COMPONENT_TYPE_INVALID,
 * TELVANE_ERROR_INVALID_ARGUMENT (JSON) or TELVANE_ERROR_NO_SESSION. */
TELVANE_EXPORT telvane_session* telvane_session_create(const char* session_info_json, const char* user_info_json,
                                                       telvane_error** error);

/* Frees the session; see "Lifetime" above for what it waits for. Accepts NULL. Never
 * from a callback of the same session. */
TELVANE_EXPORT void telvane_session_free(telvane_session* session);

/* Asks the daemon to configure the session and caches its answer (the enabled
 * backends and the event white- and blacklists, which then filter events in this
 * process). `done` may be NULL. Events sent before the answer pass the local filter. */
TELVANE_EXPORT void telvane_session_start(telvane_session* session, telvane_states_callback done, void* user_data);
/* The same, waiting at most `timeout_ms` for the answer. True when the daemon
 * answered with its configuration; false with TELVANE_ERROR_TIMED_OUT when no answer
 * came in time, false without an error when it answered without one. */
TELVANE_EXPORT bool telvane_session_start_wait(telvane_session* session, uint32_t timeout_ms, telvane_error** error);

/* Asks the daemon for the session's states again with new user information (an
 * object or NULL) and caches them. `done` may be NULL. */
TELVANE_EXPORT bool telvane_session_fetch_states(telvane_session* session, const char* user_info_json,
                                                 telvane_states_callback done, void* user_data,
                                                 telvane_error** error);

/* Receives the daemon's reply texts (and the session's display URL after a start);
 * NULL removes the callback. `destroy`, when not NULL, is called with the previous
 * user_data once the library no longer uses it (on replacement or when the session
 * goes), possibly on a worker thread. */
TELVANE_EXPORT void telvane_session_set_logging_callback(telvane_session* session, telvane_logging_callback callback,
                                                         void* user_data, telvane_destroy_callback destroy);

/* Sends an event with flag 0: category, type and a payload object (NULL for none).
 * False with TELVANE_ERROR_CATEGORY_ZERO for category 0, or TELVANE_ERROR_INVALID_ARGUMENT
 * for a payload that is not a JSON object; otherwise true, also when the session's
 * local filter dropped the event. */
TELVANE_EXPORT bool telvane_session_send(telvane_session* session, uint16_t category, uint16_t type,
                                         const char* payload_json, telvane_error** error);
/* Sends an event map: an object with "ParametersCategory", "ParametersType" and
 * optionally "ParametersPayload" (an object) and "ParametersFlag" (1: realtime, sent
 * at once). False with TELVANE_ERROR_MISSING_PARAMETER (the domain is the message) when
 * the category or the type is missing, TELVANE_ERROR_CATEGORY_ZERO for category 0,
 * TELVANE_ERROR_INVALID_ARGUMENT for a text that is not a JSON object; false without an
 * error when the session's local filter drops the event. */
TELVANE_EXPORT bool telvane_session_send_dictionary(telvane_session* session, const char* message_json,
                                                    telvane_error** error);

/* Asks the daemon to send what it holds for the session now. `done` may be NULL. */
TELVANE_EXPORT void telvane_session_flush(telvane_session* session, telvane_flush_callback done, void* user_data);
/* The same, waiting at most `timeout_ms`. True when the daemon flushed; false with
 * the daemon's error, or with TELVANE_ERROR_TIMED_OUT. */
TELVANE_EXPORT bool telvane_session_flush_wait(telvane_session* session, uint32_t timeout_ms, telvane_error** error);

/* Tells the daemon that the session is over; it sends what it holds and ends it. */
TELVANE_EXPORT void telvane_session_finish(telvane_session* session);

/* Shared data: seen by every session of the session's hierarchy (given by the
 * "HierarchyToken" of the session information) and carried in their events.
 * Replaces the shared data with an object. */
TELVANE_EXPORT bool telvane_session_update_shared_data_json(telvane_session* session, const char* shared_data_json,
                                                            telvane_error** error);
/* Sets one key to a JSON value; NULL or "null" removes the key. */
TELVANE_EXPORT bool telvane_session_update_shared_data_for_key(telvane_session* session, const char* key,
                                                               const char* value_json, telvane_error** error);

/* True when the daemon reported an upload backend for the session (known once the
 * start was answered). */
TELVANE_EXPORT bool telvane_session_server_supports_file_upload(telvane_session* session);
/* Uploads the file at the path (a "file://" URL is accepted too). The library opens
 * the file read-only here and hands the daemon the open file; after the server
 * confirms, the file is removed. False, and `done` is never called, when the path
 * is NULL or the file cannot be opened. `done` may be NULL. */
TELVANE_EXPORT bool telvane_session_upload_file(telvane_session* session, const char* path,
                                                telvane_upload_callback done, void* user_data);
/* The same, waiting at most `timeout_ms`. True when the daemon reported the upload as
 * done; false with TELVANE_ERROR_INVALID_ARGUMENT (no path, the file cannot be opened),
 * TELVANE_ERROR_UPLOAD_FAILED or TELVANE_ERROR_TIMED_OUT. */
TELVANE_EXPORT bool telvane_session_upload_file_wait(telvane_session* session, const char* path, uint32_t timeout_ms,
                                                     telvane_error** error);
/* Uploads log-data entries: a JSON array of objects with "LogData", "StartTime" and
 * "EndTime". False for a missing or empty array (`done` is then never called). */
TELVANE_EXPORT bool telvane_session_upload_data_array(telvane_session* session, const char* log_data_json,
                                                      telvane_upload_data_callback done, void* user_data,
                                                      telvane_error** error);

/* Sets the key with which the daemon signs the session's posts. False for a NULL key. */
TELVANE_EXPORT bool telvane_session_set_digest_key(telvane_session* session, const uint8_t* key, size_t length,
                                                   int32_t algorithm);

/* The local filter from the daemon's last answer: an empty whitelist lets every
 * category through. */
TELVANE_EXPORT bool telvane_session_is_whitelisted_event(telvane_session* session, uint16_t category);
TELVANE_EXPORT bool telvane_session_is_blacklisted_event(telvane_session* session, uint16_t category);
/* Why the daemon refused the session (TELVANE_ERROR_REFUSED_BY_DAEMON, the daemon's
 * reason as message), as a new error the caller frees; NULL while the daemon has not
 * refused it. Known by the time the calls it left unanswered reported their failure
 * (a _wait function returning false, a completion called with false or an error). */
TELVANE_EXPORT telvane_error* telvane_session_connection_error(telvane_session* session);
/* The enabled backends from the daemon's last answer, as a JSON array of texts (the
 * caller frees it with telvane_string_free()); NULL for a NULL session. */
TELVANE_EXPORT char* telvane_session_enabled_backends_json(telvane_session* session);

/* ---- Periodic metrics tasks ---------------------------------------------------- */

/* Registers (or replaces) the service of a module. On a log-timer tick, every module
 * registered with `need_to_update` is called on update ticks, and every module with
 * `need_to_report` on report ticks (every `reporting_multiplier`-th tick), where the
 * dictionaries its services filled are merged (objects under one key merged, arrays
 * concatenated, other values: the later wins) and sent as one realtime event. False
 * for a NULL service. `destroy`, when not NULL, is called with `user_data` once the
 * library no longer holds the service: after it was unregistered or replaced, or the
 * session was freed, and no tick runs it any more (possibly on a worker thread; a
 * service that never returns keeps it for ever). It is called at once when the
 * registration is refused. */
TELVANE_EXPORT bool telvane_session_register_periodic_task(telvane_session* session, uint32_t module,
                                                           bool need_to_update, bool need_to_report,
                                                           telvane_periodic_service service, void* user_data,
                                                           telvane_destroy_callback destroy);
/* Removes a module's service; true when one was registered. Waits for the session's
 * queue, so never from a callback. */
TELVANE_EXPORT bool telvane_session_unregister_periodic_task(telvane_session* session, uint32_t module);
/* Starts the log timer: a tick every `interval_seconds`, every
 * `reporting_multiplier`-th of them a report tick sending an event of the category
 * and type. A second start while the timer runs does nothing. */
TELVANE_EXPORT void telvane_session_start_log_timer(telvane_session* session, uint32_t interval_seconds,
                                                    uint32_t reporting_multiplier, uint16_t category, uint16_t type);
TELVANE_EXPORT void telvane_session_stop_log_timer(telvane_session* session);

/* Filling the dictionary of a periodic service; `key` is UTF-8. Each returns false
 * (and changes nothing) for a NULL argument, a value JSON cannot carry, or text that
 * is not valid JSON. */
TELVANE_EXPORT bool telvane_stats_set_json(telvane_stats* stats, const char* key, const char* value_json);
TELVANE_EXPORT bool telvane_stats_set_int(telvane_stats* stats, const char* key, int64_t value);
TELVANE_EXPORT bool telvane_stats_set_double(telvane_stats* stats, const char* key, double value);
TELVANE_EXPORT bool telvane_stats_set_bool(telvane_stats* stats, const char* key, bool value);
TELVANE_EXPORT bool telvane_stats_set_string(telvane_stats* stats, const char* key, const char* value);
/* Sets every member of a JSON object. */
TELVANE_EXPORT bool telvane_stats_update_json(telvane_stats* stats, const char* object_json);

/* ---- Without a session ----------------------------------------------------------- */

/* Sends one event over a fresh connection, without a session. False with the errors
 * of telvane_session_create() (except TELVANE_ERROR_NO_SESSION: the connection is made
 * later, on a worker thread) and of telvane_session_send(). */
TELVANE_EXPORT bool telvane_send_one_message(const char* session_info_json, const char* user_info_json,
                                             uint16_t category, uint16_t type, const char* payload_json,
                                             telvane_error** error);

/* A hierarchy token as JSON text, the caller's to free with telvane_string_free():
 * for a NULL parent (or "null") a new root token {"token": <UUID>, "level": 0}; for a
 * parent token object the same "token" one level further down. NULL for a parent
 * that is not an object or not JSON. Put it under "HierarchyToken" in the session
 * information of every session of one activity. */
TELVANE_EXPORT char* telvane_new_hierarchy_token(const char* parent_token_json);

#ifdef __cplusplus
}
#endif

#endif /* TELVANE_TELVANE_H */
