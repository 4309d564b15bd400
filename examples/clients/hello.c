/* Sends one message to tarneld through the C interface, and says after each step what came of it. */
#include <stdio.h>
#include <tarnel/tarnel_c.h>

/* The library's own texts name the remedy. */
static int failed(const char* what, const char* why) {
  fprintf(stderr, "hello: %s: %s\n", what, why);
  return 1;
}

static int set_info(tarnel_session* session) {
  tarnel_dictionary* info = tarnel_dictionary_create();
  tarnel_dictionary* user = tarnel_dictionary_create();
  tarnel_status status;

  /* Client type 8 is served the storebag "brevan", which has an entry for these two names. */
  tarnel_dictionary_set_uint64(info, TARNEL_SESSION_INFO_SESSION_ID, 42);
  tarnel_dictionary_set_int64(info, TARNEL_SESSION_INFO_CLIENT_TYPE, 8);
  tarnel_dictionary_set_bool(info, TARNEL_SESSION_INFO_REQUIRE_USER_INFO, true);
  tarnel_dictionary_set_string(user, TARNEL_USER_INFO_CLIENT_NAME, "Meetwell", TARNEL_NUL_TERMINATED);
  tarnel_dictionary_set_string(user, TARNEL_USER_INFO_SERVICE_NAME, "video-call", TARNEL_NUL_TERMINATED);
  status = tarnel_session_set_session_info(session, info, user, NULL);
  tarnel_dictionary_destroy(user);
  tarnel_dictionary_destroy(info);
  return status == TARNEL_OK ? 0 : failed("setting session info", tarnel_last_error());
}

/* The daemon answers a configuration also when it reports to nobody. */
static int configure(tarnel_session* session) {
  tarnel_reply* reply = NULL;
  int result = 0;

  if (tarnel_session_start_config_and_wait(session, 30000, &reply) != TARNEL_OK) {
    result = failed("configuring", tarnel_last_error());
  } else if (reply->names == NULL) {
    result =
        failed("configuring",
               "there is no storebag for client type 8: see the daemon's log on its fetch, which it repeats "
               "after 15 minutes, and the setting tarnel_storebag_url (tarnelctl settings list)");
  } else if (reply->name_count == 0) {
    result = failed("configuring",
                    "no backend reports: let the user agree (tarnelctl consent on), or see the daemon's log "
                    "at level debug for the rule of the storebag that says no");
  } else {
    for (size_t i = 0; i < reply->name_count; ++i) printf("configured, live backend: %s\n", reply->names[i]);
  }
  tarnel_reply_destroy(reply);
  return result;
}

static int send_hello(tarnel_session* session) {
  tarnel_dictionary* payload = tarnel_dictionary_create();
  tarnel_reply* reply = NULL;
  int result = 0;

  /* The storebag's filters let the first two fields through and replace the name by its digest. */
  tarnel_dictionary_set_string(payload, "greeting", "hello", TARNEL_NUL_TERMINATED);
  tarnel_dictionary_set_double(payload, "rtt", 12.5);
  tarnel_dictionary_set_string(payload, "userName", "zoe", TARNEL_NUL_TERMINATED);
  if (tarnel_session_send_message_and_wait(session, 7, 3, TARNEL_FLAG_NORMAL, payload, 30000, &reply) !=
      TARNEL_OK) {
    result = failed("sending", tarnel_last_error());
  } else {
    printf("sent, the daemon posts: %s\n",
           reply->text == NULL ? "(no text: held for later, or reported without the user's consent)"
                               : reply->text);
  }
  tarnel_reply_destroy(reply);
  tarnel_dictionary_destroy(payload);
  return result;
}

static int finish(tarnel_session* session) {
  if (tarnel_session_finish_and_wait(session, 30000, NULL) != TARNEL_OK)
    return failed("finishing", tarnel_last_error());
  printf("finished\n");
  return 0;
}

int main(void) {
  tarnel_session* session = NULL;
  int result;

  if (tarnel_session_create(NULL, &session) != TARNEL_OK) return failed("starting", tarnel_last_error());
  result =
      set_info(session) != 0 || configure(session) != 0 || send_hello(session) != 0 || finish(session) != 0;
  tarnel_session_destroy(session);
  return result;
}
