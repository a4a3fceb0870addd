/*
 * telvane_client_cost_c: the C client of telvane_client_cost_bench. The same client
 * as client_cost_cxx.cpp, through the C interface (telvane/telvane.h) of
 * libtelvane.so: one session, started; "ready" on standard output; on a line from
 * standard input it sends its events (their payloads written as JSON text with
 * snprintf, as a C application does), flushes, waits for the flush reply and prints
 * the CPU time and wall time this process spent from just before the first send to
 * just after that reply. See client_cost_bench.cpp for the protocol.
 *
 * Threading: the main thread only; the library's threads do the rest.
 */
#define _GNU_SOURCE
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/resource.h>
#include <time.h>

#include "telvane/telvane.h"

struct arguments {
  long events;
  int realtime;
  long component_type;
  long session_id;
  long index;
  long category;
  long type;
  const char* client_name;
  const char* service_name;
  long timeout_seconds;
};

static int parse_arguments(int argc, char** argv, struct arguments* a) {
  a->events = 20000;
  a->realtime = 0;
  a->component_type = 7;
  a->session_id = 2000;
  a->index = 0;
  a->category = 12;
  a->type = 3;
  a->client_name = "benchclient";
  a->service_name = "com.zembra.bench.delivery";
  a->timeout_seconds = 600;
  for (int i = 1; i < argc; ++i) {
    const char* equals = strchr(argv[i], '=');
    if (!equals) return 0;
    size_t length = (size_t)(equals - argv[i]);
    const char* value = equals + 1;
#define KEY(name) (length == strlen(name) && strncmp(argv[i], name, length) == 0)
    if (KEY("events")) {
      a->events = atol(value);
    } else if (KEY("mode")) {
      if (strcmp(value, "batched") != 0 && strcmp(value, "realtime") != 0) return 0;
      a->realtime = strcmp(value, "realtime") == 0;
    } else if (KEY("component-type")) {
      a->component_type = atol(value);
    } else if (KEY("session-id")) {
      a->session_id = atol(value);
    } else if (KEY("index")) {
      a->index = atol(value);
    } else if (KEY("category")) {
      a->category = atol(value);
    } else if (KEY("type")) {
      a->type = atol(value);
    } else if (KEY("client-name")) {
      a->client_name = value;
    } else if (KEY("service-name")) {
      a->service_name = value;
    } else if (KEY("timeout")) {
      a->timeout_seconds = atol(value);
    } else {
      return 0;
    }
#undef KEY
  }
  return a->events > 0 && a->timeout_seconds > 0;
}

static long long microseconds(struct timeval t) { return (long long)t.tv_sec * 1000000 + t.tv_usec; }

static long long monotonic_microseconds(void) {
  struct timespec now;
  clock_gettime(CLOCK_MONOTONIC, &now);
  return (long long)now.tv_sec * 1000000 + now.tv_nsec / 1000;
}

/* Spaces and line breaks become '_', for the one-line result. */
static void one_word(char* text) {
  for (char* c = text; *c; ++c) {
    if (*c == ' ' || *c == '\n' || *c == '\r' || *c == '\t') *c = '_';
  }
}

/* The ten keys of client_cost_cxx.cpp's payload. */
#define PAYLOAD_FORMAT                                                                             \
  "{\"name\":\"call.quality\",\"bundle\":\"com.example.conference\",\"state\":\"foreground\","     \
  "\"reason\":\"periodic\",\"count\":42,\"bytes\":123456,\"durationMs\":1500,\"clientIndex\":%ld," \
  "\"sequence\":%ld,\"ratio\":0.875}"

int main(int argc, char** argv) {
  struct arguments a;
  if (!parse_arguments(argc, argv, &a)) {
    fprintf(stderr, "usage: telvane_client_cost_c events=N mode=batched|realtime [key=value ...]\n");
    return 2;
  }
  char session_info[256];
  char user_info[512];
  snprintf(session_info, sizeof session_info,
           "{\"ComponentType\":%ld,\"SessionID\":%ld,\"ClientVersion\":1,\"BatchEvents\":true,"
           "\"RequireUserDict\":true}",
           a.component_type, a.session_id);
  snprintf(user_info, sizeof user_info, "{\"_clientName\":\"%s\",\"_serviceName\":\"%s\"}", a.client_name,
           a.service_name);
  telvane_error* error = NULL;
  telvane_session* session = telvane_session_create(session_info, user_info, &error);
  if (!session) {
    fprintf(stderr, "cannot create the session: %s (code %ld)\n", telvane_error_message(error),
            telvane_error_code(error));
    telvane_error_free(error);
    return 1;
  }
  bool configured = telvane_session_start_wait(session, 60000, &error);
  if (error) {
    fprintf(stderr, "no start reply: %s\n", telvane_error_message(error));
    telvane_error_free(error);
    telvane_session_free(session);
    return 1;
  }
  char* backends = telvane_session_enabled_backends_json(session);
  if (backends) one_word(backends);
  printf("ready configured=%d backends=%s\n", configured ? 1 : 0, backends ? backends : "-");
  fflush(stdout);
  telvane_string_free(backends);
  char line[64];
  if (!fgets(line, sizeof line, stdin)) {
    telvane_session_free(session);
    return 1;
  }

  char text[512];
  struct rusage self_before, thread_before, self_after, thread_after;
  getrusage(RUSAGE_SELF, &self_before);
  getrusage(RUSAGE_THREAD, &thread_before);
  const long long start_us = monotonic_microseconds();
  long refused = 0;
  for (long i = 0; i < a.events; ++i) {
    if (a.realtime) {
      snprintf(text, sizeof text,
               "{\"ParametersCategory\":%ld,\"ParametersType\":%ld,\"ParametersFlag\":1,"
               "\"ParametersPayload\":" PAYLOAD_FORMAT "}",
               a.category, a.type, a.index, i);
      if (!telvane_session_send_dictionary(session, text, NULL)) ++refused;
    } else {
      snprintf(text, sizeof text, PAYLOAD_FORMAT, a.index, i);
      if (!telvane_session_send(session, (uint16_t)a.category, (uint16_t)a.type, text, NULL)) ++refused;
    }
  }
  const long long sent_us = monotonic_microseconds();
  /* The flush reply comes after the reply to every event (see client_cost_cxx.cpp). */
  telvane_error* flush_error = NULL;
  const bool flushed = telvane_session_flush_wait(session, (uint32_t)(a.timeout_seconds * 1000), &flush_error);
  const long long done_us = monotonic_microseconds();
  getrusage(RUSAGE_THREAD, &thread_after);
  getrusage(RUSAGE_SELF, &self_after);

  const char* flush = "ok";
  char flush_text[256] = "-";
  if (!flushed) {
    const int timed_out = flush_error && telvane_error_code(flush_error) == TELVANE_ERROR_TIMED_OUT &&
                          strcmp(telvane_error_domain(flush_error), TELVANE_INTERFACE_ERROR_DOMAIN) == 0;
    flush = timed_out ? "timeout" : "error";
    if (flush_error) {
      snprintf(flush_text, sizeof flush_text, "%s", telvane_error_message(flush_error));
      one_word(flush_text);
    }
  }
  telvane_error_free(flush_error);
  printf(
      "result events=%ld refused=%ld user_us=%lld sys_us=%lld caller_us=%lld wall_us=%lld send_wall_us=%lld "
      "flush=%s flush_text=%s start_rss_kib=%ld peak_rss_kib=%ld\n",
      a.events, refused, microseconds(self_after.ru_utime) - microseconds(self_before.ru_utime),
      microseconds(self_after.ru_stime) - microseconds(self_before.ru_stime),
      microseconds(thread_after.ru_utime) + microseconds(thread_after.ru_stime) - microseconds(thread_before.ru_utime) -
          microseconds(thread_before.ru_stime),
      done_us - start_us, sent_us - start_us, flush, flush_text, self_before.ru_maxrss, self_after.ru_maxrss);
  fflush(stdout);
  /* The driver closes our standard input when it has read the result. */
  while (fgets(line, sizeof line, stdin)) {
  }
  telvane_session_finish(session);
  telvane_session_free(session);
  return strcmp(flush, "timeout") == 0 ? 1 : 0;
}
