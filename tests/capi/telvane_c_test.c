/*
 * telvane_c_test: a reporting client in plain C against telvane/telvane.h, run by the
 * end-to-end tests against a real daemon (found at $TELVANED_SOCKET).
 *
 *   telvane_c_test report FILE    every step of a reporting session; FILE is uploaded
 *   telvane_c_test no-daemon      session creation without a daemon to reach
 *
 * Every result of the interface is checked; each step prints one line ("ok: ..." or
 * "FAILED: ..."). Exit status 0 when every check held, 1 otherwise, 2 for bad usage.
 *
 * What "report" sends, for the test that looks at what arrived:
 *   - category 12 type 1 (batched): {"codec": "opus", "jitterMs": 12.5}
 *   - category 12 type 2 (realtime): {"reason": "lost"}
 *   - category 12 type 3 (batched): {"step": "last"}
 *   - category 14 type 3 (realtime, from the periodic tasks of modules 1 and 2):
 *     {"samples": [1, 2] merged with [3], "rxKbps": 512, "device": "Gadget2"}
 *   - shared data {"callID": "C-2041", "room": "Blue"}, the user information
 *     {"_clientName": "com.example.conference", "_serviceName": "calls", "tier": "gold"}
 */
#define _POSIX_C_SOURCE 200809L

#include <errno.h>
#include <math.h>
#include <pthread.h>
#include <stdbool.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <time.h>
#include <unistd.h>

#include <telvane/telvane.h>

enum { kReplyTimeoutMs = 30000 };

static int failures = 0;

static void check(bool condition, const char* what) {
  if (condition) {
    printf("ok: %s\n", what);
  } else {
    printf("FAILED: %s\n", what);
    ++failures;
  }
  fflush(stdout);
}

static bool same(const char* a, const char* b) { return a && b && strcmp(a, b) == 0; }

static bool contains(const char* text, const char* fragment) { return text && strstr(text, fragment) != NULL; }

/* Checks an error's code, domain and (when given) message, then frees it. */
static void check_error(telvane_error* error, long code, const char* domain, const char* message, const char* what) {
  char line[512];
  if (!error) {
    snprintf(line, sizeof line, "%s: an error (none was given)", what);
    check(false, line);
    return;
  }
  snprintf(line, sizeof line, "%s: error %ld in %s: %s", what, telvane_error_code(error), telvane_error_domain(error),
           telvane_error_message(error));
  check(telvane_error_code(error) == code && same(telvane_error_domain(error), domain) &&
            (!message || same(telvane_error_message(error), message)) &&
            telvane_error_user_info_json(error) != NULL,
        line);
  telvane_error_free(error);
}

static void check_no_error(telvane_error* error, const char* what) {
  char line[512];
  if (error) {
    snprintf(line, sizeof line, "%s: no error (got %ld in %s: %s)", what, telvane_error_code(error),
             telvane_error_domain(error), telvane_error_message(error));
    telvane_error_free(error);
    check(false, line);
    return;
  }
  snprintf(line, sizeof line, "%s: no error", what);
  check(true, line);
}

/* ---- Waiting for callbacks of the library's threads, with a deadline ---------- */

typedef struct {
  pthread_mutex_t mutex;
  pthread_cond_t changed;
  int flushes;            /* flush completions */
  int flush_errors;       /* of which with an error */
  int uploads_succeeded;  /* upload completions with success */
  int uploads_failed;
  int logged_texts;       /* daemon reply texts */
  int logging_destroyed;  /* the logging callback's user data released */
  int service_calls[3];   /* per module 1, 2 */
  int services_destroyed; /* periodic services' user data released */
  int refused_destroyed;  /* the refused registration's user data released */
} Progress;

static Progress progress = {PTHREAD_MUTEX_INITIALIZER, PTHREAD_COND_INITIALIZER, 0, 0, 0, 0, 0, 0, {0, 0, 0}, 0, 0};

static void bump(int* counter) {
  pthread_mutex_lock(&progress.mutex);
  ++*counter;
  pthread_cond_broadcast(&progress.changed);
  pthread_mutex_unlock(&progress.mutex);
}

/* Waits until *counter reaches at least `count`; false when the deadline passed. */
static bool wait_for(const int* counter, int count, int timeout_ms) {
  struct timespec deadline;
  clock_gettime(CLOCK_REALTIME, &deadline);
  deadline.tv_sec += timeout_ms / 1000;
  deadline.tv_nsec += (long)(timeout_ms % 1000) * 1000000L;
  if (deadline.tv_nsec >= 1000000000L) {
    deadline.tv_sec += 1;
    deadline.tv_nsec -= 1000000000L;
  }
  pthread_mutex_lock(&progress.mutex);
  int rc = 0;
  while (*counter < count && rc != ETIMEDOUT) rc = pthread_cond_timedwait(&progress.changed, &progress.mutex, &deadline);
  bool reached = *counter >= count;
  pthread_mutex_unlock(&progress.mutex);
  return reached;
}

static int read_counter(const int* counter) {
  pthread_mutex_lock(&progress.mutex);
  int value = *counter;
  pthread_mutex_unlock(&progress.mutex);
  return value;
}

/* ---- Callbacks ----------------------------------------------------------------- */

static const char kTag[] = "c-test";

static void on_logged(const char* text, void* user_data) {
  if (text && user_data == kTag) bump(&progress.logged_texts);
}

static void on_logging_destroyed(void* user_data) {
  if (user_data == kTag) bump(&progress.logging_destroyed);
}

static void on_flushed(const telvane_error* error, void* user_data) {
  if (user_data != kTag) return;
  if (error) {
    printf("flush completion: error %ld in %s: %s\n", telvane_error_code(error), telvane_error_domain(error),
           telvane_error_message(error));
    bump(&progress.flush_errors);
  }
  bump(&progress.flushes);
}

static void on_uploaded(bool succeeded, void* user_data) {
  if (user_data != kTag) return;
  bump(succeeded ? &progress.uploads_succeeded : &progress.uploads_failed);
}

typedef struct {
  int module;
} Module;

static Module module_one = {1};
static Module module_two = {2};

/* The services of two modules; they may run at the same time on different threads. */
static void fill_stats(telvane_stats* stats, void* user_data) {
  const Module* module = user_data;
  bool filled;
  if (module->module == 1) {
    filled = telvane_stats_set_json(stats, "samples", "[1, 2]") && telvane_stats_set_int(stats, "rxKbps", 512) &&
             telvane_stats_set_string(stats, "device", "Gadget1");
  } else {
    filled = telvane_stats_update_json(stats, "{\"samples\": [3]}") &&
             telvane_stats_set_string(stats, "device", "Gadget2") && telvane_stats_set_double(stats, "load", 0.25) &&
             telvane_stats_set_bool(stats, "charging", true);
  }
  /* What the statistics refuse, without changing what was filled. */
  bool refused = !telvane_stats_set_json(stats, "broken", "{not json") && !telvane_stats_set_json(stats, NULL, "1") &&
                 !telvane_stats_set_string(stats, "nothing", NULL) &&
                 !telvane_stats_update_json(stats, "[1]") && !telvane_stats_set_double(stats, "nan", NAN);
  if (filled && refused) bump(&progress.service_calls[module->module]);
}

static void on_service_destroyed(void* user_data) {
  if (user_data == &module_one || user_data == &module_two) bump(&progress.services_destroyed);
}

static void on_refused_destroyed(void* user_data) {
  if (user_data == kTag) bump(&progress.refused_destroyed);
}

/* ---- The steps ----------------------------------------------------------------- */

/* What is refused before any connection is made. */
static void check_refusals(void) {
  telvane_error* error = NULL;
  check(telvane_session_create(NULL, NULL, &error) == NULL, "create without session information gives no session");
  check_error(error, TELVANE_ERROR_SESSION_INFO_MISSING, TELVANE_ERROR_DOMAIN, "sessionInfo is nil",
              "create without session information");

  error = NULL;
  check(telvane_session_create("{\"ComponentType\": 4}", NULL, &error) == NULL, "component type 4 gives no session");
  check_error(error, TELVANE_ERROR_COMPONENT_TYPE_INVALID, TELVANE_ERROR_DOMAIN, "clientType is invalid",
              "component type 4");

  error = NULL;
  check(telvane_session_create("{\"ComponentType\": 31}", NULL, &error) == NULL, "component type 31 gives no session");
  check_error(error, TELVANE_ERROR_COMPONENT_TYPE_INVALID, TELVANE_ERROR_DOMAIN, NULL, "component type 31");

  error = NULL;
  check(telvane_session_create("{\"ComponentType\": 7", NULL, &error) == NULL, "unreadable JSON gives no session");
  check_error(error, TELVANE_ERROR_INVALID_ARGUMENT, TELVANE_INTERFACE_ERROR_DOMAIN, NULL, "unreadable JSON");

  error = NULL;
  check(telvane_session_create("{\"ComponentType\": 7}", "[\"calls\"]", &error) == NULL,
        "user information that is not an object gives no session");
  check_error(error, TELVANE_ERROR_INVALID_ARGUMENT, TELVANE_INTERFACE_ERROR_DOMAIN, NULL,
              "user information that is not an object");

  error = NULL;
  check(!telvane_send_one_message("{\"ComponentType\": 7}", NULL, 0, 1, NULL, &error),
        "a one-shot event of category 0 is refused");
  check_error(error, TELVANE_ERROR_CATEGORY_ZERO, TELVANE_ERROR_DOMAIN, NULL, "one-shot event of category 0");

  error = NULL;
  check(!telvane_send_one_message("{\"ComponentType\": 3}", NULL, 12, 1, NULL, &error),
        "a one-shot event of component type 3 is refused");
  check_error(error, TELVANE_ERROR_COMPONENT_TYPE_INVALID, TELVANE_ERROR_DOMAIN, NULL, "one-shot component type 3");

  error = NULL;
  check(!telvane_session_send(NULL, 12, 1, NULL, &error), "sending without a session is refused");
  check_error(error, TELVANE_ERROR_INVALID_ARGUMENT, TELVANE_INTERFACE_ERROR_DOMAIN, "no session",
              "sending without a session");

  char* root = telvane_new_hierarchy_token(NULL);
  check(contains(root, "\"level\":0") && contains(root, "\"token\":\""), "a root hierarchy token has level 0");
  char* child = telvane_new_hierarchy_token(root);
  check(contains(child, "\"level\":1"), "its child token has level 1");
  if (root && child) {
    /* {"level":N,"token":"<uuid>"}: the same token text after the level. */
    check(same(strstr(root, "\"token\""), strstr(child, "\"token\"")), "the child keeps the token");
  }
  telvane_string_free(child);
  telvane_string_free(root);
  check(telvane_new_hierarchy_token("[1]") == NULL, "a parent that is not an object gives no token");
  check(telvane_version() != NULL && telvane_version()[0] != '\0', "the library has a version");
  telvane_session_free(NULL);
  telvane_error_free(NULL);
}

/* A batched event: it waits in the daemon for a flush. */
static void send_batched(telvane_session* session, uint16_t type, const char* payload) {
  char what[64];
  snprintf(what, sizeof what, "batched event 12/%u", (unsigned)type);
  telvane_error* error = (telvane_error*)1; /* set to NULL on success */
  check(telvane_session_send(session, 12, type, payload, &error), what);
  check_no_error(error, what);
}

/* The refusals of events, and a realtime event (sent at once; sent after a batched
 * one it would take the batch along). */
static void send_events(telvane_session* session) {
  telvane_error* error = NULL;
  check(!telvane_session_send(session, 0, 1, "{\"codec\": \"opus\"}", &error), "category 0 is refused");
  check_error(error, TELVANE_ERROR_CATEGORY_ZERO, TELVANE_ERROR_DOMAIN, NULL, "category 0");

  error = NULL;
  check(!telvane_session_send(session, 12, 1, "{\"codec\": ", &error), "an unreadable payload is refused");
  check_error(error, TELVANE_ERROR_INVALID_ARGUMENT, TELVANE_INTERFACE_ERROR_DOMAIN, NULL, "unreadable payload");

  error = NULL;
  check(!telvane_session_send(session, 12, 1, "[1, 2]", &error), "a payload that is not an object is refused");
  check_error(error, TELVANE_ERROR_INVALID_ARGUMENT, TELVANE_INTERFACE_ERROR_DOMAIN, NULL, "payload array");

  error = NULL;
  check(!telvane_session_send_dictionary(session, "{\"ParametersType\": 1}", &error),
        "an event map without its category is refused");
  check_error(error, TELVANE_ERROR_MISSING_PARAMETER, "Missing mandatory parameter 'category'",
              "Missing mandatory parameter 'category'", "event map without category");

  error = NULL;
  check(!telvane_session_send_dictionary(session, "{\"ParametersCategory\": 12}", &error),
        "an event map without its type is refused");
  check_error(error, TELVANE_ERROR_MISSING_PARAMETER, "Missing mandatory parameter 'type'",
              "Missing mandatory parameter 'type'", "event map without type");

  error = NULL;
  check(!telvane_session_send_dictionary(session, "{\"ParametersCategory\": 0, \"ParametersType\": 1}", &error),
        "an event map of category 0 is refused");
  check_error(error, TELVANE_ERROR_CATEGORY_ZERO, TELVANE_ERROR_DOMAIN, NULL, "event map of category 0");

  error = (telvane_error*)1;
  check(telvane_session_send_dictionary(session,
                                        "{\"ParametersCategory\": 12, \"ParametersType\": 2, \"ParametersFlag\": 1, "
                                        "\"ParametersPayload\": {\"reason\": \"lost\"}}",
                                        &error),
        "realtime event 12/2 is sent");
  check_no_error(error, "realtime event 12/2");
}

static void run_periodic_tasks(telvane_session* session) {
  check(!telvane_session_register_periodic_task(session, 9, true, true, NULL, (void*)kTag, on_refused_destroyed),
        "a periodic task without a service is refused");
  check(read_counter(&progress.refused_destroyed) == 1, "the refused task's user data is released at once");
  check(telvane_session_register_periodic_task(session, 1, false, true, fill_stats, &module_one, on_service_destroyed),
        "module 1 is registered (report only)");
  check(telvane_session_register_periodic_task(session, 2, true, true, fill_stats, &module_two, on_service_destroyed),
        "module 2 is registered (update and report)");

  /* Multiplier 1: every tick is a report tick; the first one comes at once. */
  telvane_session_start_log_timer(session, 1, 1, 14, 3);
  check(wait_for(&progress.service_calls[1], 1, kReplyTimeoutMs) &&
            wait_for(&progress.service_calls[2], 1, kReplyTimeoutMs),
        "both modules filled their statistics on a report tick");
  telvane_session_stop_log_timer(session);

  check(telvane_session_unregister_periodic_task(session, 1), "module 1 is unregistered");
  check(!telvane_session_unregister_periodic_task(session, 1), "module 1 is no longer there");
  check(telvane_session_unregister_periodic_task(session, 2), "module 2 is unregistered");
  check(wait_for(&progress.services_destroyed, 2, kReplyTimeoutMs), "both services' user data are released");
}

static void upload(telvane_session* session, const char* path) {
  telvane_error* error = NULL;
  check(telvane_session_server_supports_file_upload(session), "the session has an upload backend");
  check(telvane_session_upload_file_wait(session, path, kReplyTimeoutMs, &error), "the file is uploaded");
  check_no_error(error, "upload");
  check(access(path, F_OK) != 0, "the server's success answer removed the file");

  error = NULL;
  check(!telvane_session_upload_file_wait(session, path, kReplyTimeoutMs, &error), "a missing file is refused");
  check_error(error, TELVANE_ERROR_INVALID_ARGUMENT, TELVANE_INTERFACE_ERROR_DOMAIN, NULL, "missing file");
  check(!telvane_session_upload_file(session, NULL, on_uploaded, (void*)kTag), "an upload without a path is refused");
  check(!telvane_session_upload_file(session, path, on_uploaded, (void*)kTag),
        "an upload of a file that is gone is refused");
  check(read_counter(&progress.uploads_succeeded) + read_counter(&progress.uploads_failed) == 0,
        "refused uploads call no completion");
}

static int report(const char* upload_path) {
  check_refusals();

  char* token = telvane_new_hierarchy_token(NULL);
  check(token != NULL, "a hierarchy token for the session");
  char session_info[512];
  snprintf(session_info, sizeof session_info,
           "{\"ComponentType\": 7, \"SessionID\": 4242, \"ClientVersion\": 5, \"BatchEvents\": true, "
           "\"RequireUserDict\": true, \"HierarchyToken\": %s}",
           token ? token : "null");
  telvane_string_free(token);

  telvane_error* error = (telvane_error*)1;
  telvane_session* session = telvane_session_create(
      session_info, "{\"_clientName\": \"com.example.conference\", \"_serviceName\": \"calls\", \"tier\": \"gold\"}",
      &error);
  check(session != NULL, "a session is made");
  check_no_error(error, "create");
  if (!session) return 1;
  telvane_session_set_logging_callback(session, on_logged, (void*)kTag, on_logging_destroyed);
  check(telvane_session_connection_error(session) == NULL, "the daemon has not refused the session");

  error = (telvane_error*)1;
  check(telvane_session_start_wait(session, kReplyTimeoutMs, &error), "the daemon configured the session");
  check_no_error(error, "start");
  char* backends = telvane_session_enabled_backends_json(session);
  printf("enabled backends: %s\n", backends ? backends : "(none)");
  check(contains(backends, "\"brindle\"") && contains(backends, "\"upload_server\""),
        "the daemon enabled the post and upload backends");
  telvane_string_free(backends);
  check(telvane_session_is_whitelisted_event(session, 12) && !telvane_session_is_blacklisted_event(session, 12),
        "category 12 passes the local filter");

  error = NULL;
  check(telvane_session_update_shared_data_json(session, "{\"callID\": \"C-2041\"}", &error), "shared data is set");
  check_no_error(error, "shared data");
  error = NULL;
  check(telvane_session_update_shared_data_for_key(session, "room", "\"Blue\"", &error), "a shared-data key is set");
  check_no_error(error, "shared-data key");
  error = NULL;
  check(!telvane_session_update_shared_data_json(session, "\"C-2041\"", &error),
        "shared data that is not an object is refused");
  check_error(error, TELVANE_ERROR_INVALID_ARGUMENT, TELVANE_INTERFACE_ERROR_DOMAIN, NULL, "shared data text");

  send_events(session);
  run_periodic_tasks(session);

  send_batched(session, 1, "{\"codec\": \"opus\", \"jitterMs\": 12.5}");
  error = (telvane_error*)1;
  check(telvane_session_flush_wait(session, kReplyTimeoutMs, &error), "the daemon flushed the session");
  check_no_error(error, "flush");
  check(read_counter(&progress.logged_texts) >= 1, "the daemon's reply texts reached the logging callback");

  upload(session, upload_path);

  send_batched(session, 3, "{\"step\": \"last\"}");
  telvane_session_flush(session, on_flushed, (void*)kTag);
  check(wait_for(&progress.flushes, 1, kReplyTimeoutMs) && read_counter(&progress.flush_errors) == 0,
        "the flush completion reports success");
  /* The daemon's own refusal comes back as the error it gave. */
  error = NULL;
  check(!telvane_session_flush_wait(session, kReplyTimeoutMs, &error), "a flush with nothing batched fails");
  check_error(error, -1, TELVANE_ERROR_DOMAIN, "Nothing to flush", "flush with nothing batched");
  telvane_session_flush(session, on_flushed, (void*)kTag);
  check(wait_for(&progress.flushes, 2, kReplyTimeoutMs) && read_counter(&progress.flush_errors) == 1,
        "the flush completion reports the daemon's error");
  check(!telvane_session_set_digest_key(session, NULL, 0, 1), "a digest key is required");

  telvane_session_finish(session);
  telvane_session_free(session);
  check(read_counter(&progress.logging_destroyed) == 1, "freeing the session released the logging callback");
  printf("%s\n", failures == 0 ? "all checks passed" : "some checks failed");
  return failures == 0 ? 0 : 1;
}

static int no_daemon(void) {
  telvane_error* error = NULL;
  telvane_session* session = telvane_session_create(
      "{\"ComponentType\": 7, \"SessionID\": 1}", "{\"_clientName\": \"com.example.conference\"}", &error);
  check(session == NULL, "no session is made without a daemon");
  check_error(error, TELVANE_ERROR_NO_SESSION, TELVANE_INTERFACE_ERROR_DOMAIN, NULL, "no daemon");
  telvane_session_free(session);

  error = NULL;
  check(!telvane_session_start_wait(NULL, 10, &error), "starting no session is refused");
  check_error(error, TELVANE_ERROR_INVALID_ARGUMENT, TELVANE_INTERFACE_ERROR_DOMAIN, NULL, "start without a session");
  printf("%s\n", failures == 0 ? "all checks passed" : "some checks failed");
  return failures == 0 ? 0 : 1;
}

int main(int argc, char** argv) {
  setvbuf(stdout, NULL, _IOLBF, 0);
  if (argc == 3 && strcmp(argv[1], "report") == 0) return report(argv[2]);
  if (argc == 2 && strcmp(argv[1], "no-daemon") == 0) return no_daemon();
  fprintf(stderr, "usage: %s report FILE | no-daemon\n", argv[0]);
  return 2;
}
