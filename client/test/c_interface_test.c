/* The C interface from C, against the shared library. Prints what failed; exits with the number of failures.
 */
#include <stdio.h>
#include <string.h>

#include "tarnel/tarnel_c.h"

static int failures = 0;

#define CHECK(condition)                                      \
  do {                                                        \
    if (!(condition)) {                                       \
      fprintf(stderr, "line %d: %s\n", __LINE__, #condition); \
      ++failures;                                             \
    }                                                         \
  } while (0)

static void values(void) {
  tarnel_dictionary* dictionary = tarnel_dictionary_create();
  tarnel_array* array = tarnel_array_create();
  const uint8_t bytes[] = {1, 2, 3};
  size_t length = 0;
  CHECK(tarnel_array_append_bool(array, true) == TARNEL_OK);
  CHECK(tarnel_array_append_data(array, bytes, sizeof bytes) == TARNEL_OK);
  CHECK(tarnel_array_append_string(array, "cut here", 3) == TARNEL_OK);
  CHECK(tarnel_array_append_date(array, 2.5) == TARNEL_OK);
  CHECK(tarnel_dictionary_set_int64(dictionary, "i", -1) == TARNEL_OK);
  CHECK(tarnel_dictionary_set_uint64(dictionary, "u", UINT64_MAX) == TARNEL_OK);
  CHECK(tarnel_dictionary_set_double(dictionary, "d", 0.5) == TARNEL_OK);
  CHECK(tarnel_dictionary_set_array(dictionary, "a", array) == TARNEL_OK);
  CHECK(tarnel_dictionary_set_string(dictionary, "s", NULL, 0) == TARNEL_ERROR_INVALID_ARGUMENT);
  tarnel_array_destroy(array);

  CHECK(tarnel_dictionary_count(dictionary) == 4);
  CHECK(strcmp(tarnel_dictionary_key_at(dictionary, 1), "u") == 0);
  CHECK(tarnel_dictionary_key_at(dictionary, 4) == NULL);
  CHECK(tarnel_value_int64(tarnel_dictionary_value_at(dictionary, 0)) == -1);
  CHECK(tarnel_value_uint64(tarnel_dictionary_find(dictionary, "u")) == UINT64_MAX);
  CHECK(tarnel_value_type(tarnel_dictionary_find(dictionary, "u")) == TARNEL_TYPE_UNSIGNED_INTEGER);
  CHECK(tarnel_value_double(tarnel_dictionary_find(dictionary, "d")) == 0.5);
  const tarnel_array* held = tarnel_value_array(tarnel_dictionary_find(dictionary, "a"));
  CHECK(tarnel_array_count(held) == 4);
  CHECK(tarnel_value_bool(tarnel_array_value_at(held, 0)));
  CHECK(tarnel_value_data(tarnel_array_value_at(held, 1), &length)[2] == 3 && length == 3);
  CHECK(strcmp(tarnel_value_string(tarnel_array_value_at(held, 2), &length), "cut") == 0 && length == 3);
  CHECK(tarnel_value_date(tarnel_array_value_at(held, 3)) == 2.5);

  tarnel_dictionary* copy = tarnel_dictionary_copy(dictionary);
  CHECK(tarnel_dictionary_remove(copy, "i"));
  CHECK(!tarnel_dictionary_remove(copy, "i"));
  CHECK(tarnel_dictionary_find(dictionary, "i") != NULL);
  tarnel_dictionary_destroy(copy);
  tarnel_dictionary_destroy(dictionary);
}

static void absent_daemon(void) {
  tarnel_options options;
  tarnel_session* session = NULL;
  tarnel_reply* reply = NULL;
  tarnel_options_init(&options, sizeof options);
  options.socket_path = "/nonexistent/socket";
  CHECK(tarnel_session_create(&options, &session) == TARNEL_OK);
  CHECK(tarnel_session_start_config_and_wait(session, 30000, &reply) == TARNEL_ERROR_NO_DAEMON);
  CHECK(strcmp(tarnel_last_error(),
               "no daemon is listening at /nonexistent/socket: start the daemon of that instance, or name "
               "another socket "
               "(TARNEL_SOCKET)") == 0);
  tarnel_reply_destroy(reply);
  CHECK(tarnel_session_send_message(session, 1, 1, 4, NULL, NULL, NULL) == TARNEL_ERROR_INVALID_ARGUMENT);
  tarnel_session_destroy(session);
}

int main(void) {
  CHECK(strcmp(tarnel_version(), "1.0.0") == 0);
  values();
  absent_daemon();
  return failures;
}
