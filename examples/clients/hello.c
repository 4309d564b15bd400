/* Sends one message to tarneld through the C interface. */
#include <stdio.h>
#include <tarnel/tarnel_c.h>

static int failed(const char* what) {
  fprintf(stderr, "hello: %s: %s\n", what, tarnel_last_error());
  return 1;
}

static int report(tarnel_session* session) {
  tarnel_dictionary* info = tarnel_dictionary_create();
  tarnel_dictionary* payload = tarnel_dictionary_create();
  tarnel_reply* reply = NULL;
  int result = 0;

  tarnel_dictionary_set_uint64(info, TARNEL_SESSION_INFO_SESSION_ID, 42);
  tarnel_dictionary_set_int64(info, TARNEL_SESSION_INFO_CLIENT_TYPE, 1);
  tarnel_dictionary_set_string(payload, "greeting", "hello", TARNEL_NUL_TERMINATED);
  tarnel_dictionary_set_double(payload, "rtt", 12.5);

  if (tarnel_session_set_session_info(session, info, NULL, NULL) != TARNEL_OK) {
    result = failed("setting session info");
  } else if (tarnel_session_start_config_and_wait(session, 30000, &reply) != TARNEL_OK) {
    result = failed("configuring");
  } else {
    for (size_t i = 0; i < reply->name_count; ++i) printf("live backend: %s\n", reply->names[i]);
    if (tarnel_session_send_message(session, 7, 3, TARNEL_FLAG_NORMAL, payload, NULL, NULL) != TARNEL_OK) {
      result = failed("sending");
    } else if (tarnel_session_finish_and_wait(session, 30000, NULL) != TARNEL_OK) {
      result = failed("finishing");
    }
  }
  tarnel_reply_destroy(reply);
  tarnel_dictionary_destroy(payload);
  tarnel_dictionary_destroy(info);
  return result;
}

int main(void) {
  tarnel_session* session = NULL;
  if (tarnel_session_create(NULL, &session) != TARNEL_OK) return failed("starting");
  const int result = report(session);
  tarnel_session_destroy(session);
  return result;
}
