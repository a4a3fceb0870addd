/* A C program that uses the installed client library through its C interface; it
   needs no daemon. Exit status 0 when every check holds. */
#include <telvane/telvane.h>

#include <stdio.h>
#include <string.h>

int main(void) {
  int failures = 0;
  telvane_error* error = NULL;
  telvane_session* session =
      telvane_session_create("{\"ComponentType\": 31, \"SessionID\": 1}", NULL, &error);
  if (session != NULL || error == NULL || telvane_error_code(error) != 3 ||
      strcmp(telvane_error_domain(error), "TelvaneErrorDomain") != 0) {
    fprintf(stderr, "c consumer: component type 31 must give error 3\n");
    ++failures;
  }
  telvane_error_free(error);

  char* token = telvane_new_hierarchy_token(NULL);
  if (token == NULL || strstr(token, "\"level\"") == NULL) {
    fprintf(stderr, "c consumer: no root token\n");
    ++failures;
  }
  if (failures == 0) printf("c consumer: ok (library %s, token %s)\n", telvane_version(), token);
  telvane_string_free(token);
  return failures == 0 ? 0 : 1;
}
