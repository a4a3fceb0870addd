/* metrix_adaptor_file: a wireless-diagnostics adaptor that writes every event it
 * receives to a file, one line per event:
 *
 *     <method> <respCode> <dictionary as JSON>\n
 *
 * The file is named by $METRIX_ADAPTOR_OUTPUT (read at each call); without it the
 * adaptor drops the events. The JSON text is compact, so it holds no line break.
 *
 * Point the daemon at it with TELVANED_METRIX_ADAPTOR=/path/to/metrix_adaptor_file.so.
 *
 * The daemon may call the entry from several threads at once. Each line is written
 * with one write() on a descriptor opened with O_APPEND, under a process-wide lock,
 * so lines of concurrent calls never interleave (O_APPEND keeps writers of other
 * processes at the end of the file too). The work is one short local write; an
 * adaptor that talks to something slow would hand the text to a thread of its own.
 */
#define _POSIX_C_SOURCE 200809L /* O_CLOEXEC */

#include <telvane/MetrixAdaptor.h>

#include <errno.h>
#include <fcntl.h>
#include <pthread.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#define OUTPUT_ENV "METRIX_ADAPTOR_OUTPUT"

static pthread_mutex_t write_lock = PTHREAD_MUTEX_INITIALIZER;

static void write_all(int fd, const char *data, size_t length) {
  while (length > 0) {
    ssize_t written = write(fd, data, length);
    if (written < 0) {
      if (errno == EINTR) continue;
      return;
    }
    data += written;
    length -= (size_t)written;
  }
}

__attribute__((visibility("default"))) void telvane_metrix_adaptor_send_message(uint16_t method, uint16_t resp_code,
                                                                                const char *dict_json,
                                                                                size_t dict_json_length) {
  const char *path = getenv(OUTPUT_ENV);
  if (!path || !*path) return;

  char head[32];
  int head_length = snprintf(head, sizeof head, "%u %u ", (unsigned)method, (unsigned)resp_code);
  if (head_length < 0 || (size_t)head_length >= sizeof head) return;
  size_t line_length = (size_t)head_length + dict_json_length + 1;
  char *line = malloc(line_length);
  if (!line) return;
  memcpy(line, head, (size_t)head_length);
  /* The text is only borrowed for this call: it is copied before the call returns. */
  memcpy(line + head_length, dict_json, dict_json_length);
  line[line_length - 1] = '\n';

  pthread_mutex_lock(&write_lock);
  int fd = open(path, O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
  if (fd >= 0) {
    write_all(fd, line, line_length);
    close(fd);
  }
  pthread_mutex_unlock(&write_lock);
  free(line);
}
