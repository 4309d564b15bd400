#ifndef TARNEL_TARNEL_C_SESSION_H_
#define TARNEL_TARNEL_C_SESSION_H_

/* A reporting session with the daemon, in C.
 *
 * Each session has one I/O thread, which connects, sends, receives and runs all of the session's callbacks,
 * one at a time. Calls only put their arguments into a bounded queue and return, except those whose name ends
 * in _and_wait, tarnel_session_drain and tarnel_session_destroy, which wait as they say. Calls reach the
 * daemon in the order in which they were accepted.
 *
 * The usual course: create, set_session_info, start_config, any number of messages, finish, destroy.
 *
 * Threads: every function may be called from any thread and from the session's callbacks, with these
 * exceptions: a session is destroyed once, and not used during or after that; waiting functions refuse to be
 * called from the session's own callbacks.
 * fork(): in the child a session made before is inert: its functions return TARNEL_ERROR_FORKED, its
 * callbacks never run, and its descriptors are closed. Sessions made in the child work.
 * exit(): when the process ends while sessions exist, what waits is still sent within their linger time,
 * but no callback is begun any more.
 * Signals: the I/O thread takes none, and writing to a lost connection raises none. */

#include "tarnel/tarnel_c_types.h"
#include "tarnel/tarnel_c_value.h"

#ifdef __cplusplus
extern "C" {
#endif

typedef struct tarnel_session tarnel_session;

/* How a message is delivered; a bit set. */
typedef uint32_t tarnel_flag;
enum { TARNEL_FLAG_NORMAL = 0, TARNEL_FLAG_REALTIME = 1, TARNEL_FLAG_IMPORTANT = 2 };

typedef int32_t tarnel_session_state;
enum {
  TARNEL_STATE_CONNECTING = 0,
  TARNEL_STATE_CONNECTED = 1,
  TARNEL_STATE_INTERRUPTED = 2, /* no daemon, or the connection was lost */
  TARNEL_STATE_INVALIDATED = 3, /* the daemon does not let this process in */
  TARNEL_STATE_CLOSED = 4
};

/* Why the connection is gone. */
typedef struct tarnel_disconnection {
  size_t size;
  tarnel_status status;
  const char* message; /* one sentence with the remedy */
  /* Calls that were accepted without a completion and never sent. (Those with one were told by it.) */
  uint64_t lost_calls;
} tarnel_disconnection;

/* Runs after the completions of everything that was under way. disconnection: valid during the callback.
 * tarnel_session_reconnect may be called from here. */
typedef void (*tarnel_disconnection_handler)(void* context, const tarnel_disconnection* disconnection);

/* A message of this session or of one below it in the hierarchy, for a client that aggregates.
 * message_info: the sending session's info, or NULL. timestamp: seconds since 1970. payload: or NULL, with
 * the sending session's user info merged in. Both dictionaries are valid during the callback; copy to keep.
 */
typedef void (*tarnel_aggregation_handler)(void* context, const tarnel_dictionary* message_info,
                                           double timestamp, uint16_t category, uint16_t type,
                                           const tarnel_dictionary* payload);
/* The daemon will send no further message to aggregate. */
typedef void (*tarnel_aggregation_end_handler)(void* context);

typedef struct tarnel_options {
  size_t size;
  /* The daemon's socket, an absolute path of at most 107 bytes. NULL: the environment variable TARNEL_SOCKET
   * (which set-user-id and set-group-id programs ignore), else /run/tarneld/com.orvane.tarneld. */
  const char* socket_path;
  /* Calls that may wait to be sent; 1 to 1,000,000, default 4,096. */
  uint32_t max_queued_calls;
  /* Bytes, as sent, of the calls that wait; 1,024 to 268,435,456, default 8,388,608. */
  uint32_t max_queued_bytes;
  /* Calls sent whose answers have not come; 1 to 65,536, default 256. Further ones wait in the queue. */
  uint32_t max_unanswered;
  /* For reaching the daemon; 1 to 600,000 ms, default 10,000. */
  uint32_t connect_timeout_ms;
  /* From sending a call to its answer; 1 to 86,400,000 ms, default 120,000. Uploads, and calls that are sent
   * while one is under way, have a day. */
  uint32_t reply_timeout_ms;
  /* How long destroying, and the end of the process, wait for what is still to be sent and answered; 0 to
   * 60,000 ms, default 200. */
  uint32_t linger_ms;
  /* All may be NULL. A session is an aggregator exactly if on_aggregated_message is set. */
  tarnel_disconnection_handler on_interruption; /* reconnecting may help: no daemon, or connection lost */
  tarnel_disconnection_handler on_invalidation; /* refused: reconnecting helps once the cause is removed */
  tarnel_aggregation_handler on_aggregated_message;
  tarnel_aggregation_end_handler on_aggregation_end;
  /* Handed to the four handlers. */
  void* context;
  /* Called once, on the I/O thread, when none of them will run any more (not when the process ends first, in
   * a forked child, or when the session could not be made). */
  void (*release_context)(void* context);
} tarnel_options;

/* Fills in the defaults. size: sizeof(tarnel_options) of the caller. */
TARNEL_API void tarnel_options_init(tarnel_options* options, size_t size);

/* Makes a session and begins to connect.
 * options: may be NULL for the defaults. session: receives the session, owned by the caller; NULL on failure.
 * A missing daemon is no failure here: on_interruption and the completions tell it.
 * TARNEL_ERROR_INVALID_ARGUMENT for an option out of its range; TARNEL_ERROR_SYSTEM. */
TARNEL_API tarnel_status tarnel_session_create(const tarnel_options* options, tarnel_session** session);

/* Closes the connection and frees the session. NULL is allowed.
 * Waits, at most linger_ms, until what was accepted has been sent and answered, and for a callback that
 * runs; what then remains is told TARNEL_ERROR_CLOSED. After it returned no callback of the session runs.
 * From one of the session's callbacks it does not wait, and the remaining completions run after it. */
TARNEL_API void tarnel_session_destroy(tarnel_session* session);

/* Connects anew after an interruption or invalidation; the session must be configured again. Does nothing
 * while connecting or connected. TARNEL_ERROR_FORKED, TARNEL_ERROR_CLOSED. */
TARNEL_API tarnel_status tarnel_session_reconnect(tarnel_session* session);
TARNEL_API tarnel_session_state tarnel_session_get_state(const tarnel_session* session);

/* Waits until everything accepted before has been sent, read by the daemon and answered.
 * timeout_ms: 1 to 86,400,000. TARNEL_ERROR_TIMED_OUT, and the errors of an interrupted call. */
TARNEL_API tarnel_status tarnel_session_drain(tarnel_session* session, uint32_t timeout_ms);

/* The calls.
 *
 * Every call returns TARNEL_OK when it was accepted, else
 *   TARNEL_ERROR_INVALID_ARGUMENT, TARNEL_ERROR_TOO_LARGE (bad arguments),
 *   TARNEL_ERROR_QUEUE_FULL,
 *   the reason of the disconnection while interrupted or invalidated (TARNEL_ERROR_NO_DAEMON,
 *   TARNEL_ERROR_REFUSED, TARNEL_ERROR_INTERRUPTED, TARNEL_ERROR_TIMED_OUT),
 *   TARNEL_ERROR_CLOSED, TARNEL_ERROR_FORKED, TARNEL_ERROR_SYSTEM.
 * completion: may be NULL; then no answer is asked of the daemon. context: handed to it.
 * The _and_wait forms wait for the answer, at most timeout_ms (1 to 86,400,000); then
 * TARNEL_ERROR_TIMED_OUT, while the call itself stays under way. They return the reply's status.
 * reply: receives the answer, to be freed with tarnel_reply_destroy, or NULL when there is none; may be NULL.
 * Dictionaries and arrays: borrowed for the call; NULL means none unless said otherwise. */

/* Configures the session; before start_config. No answer.
 * session_info: keys TARNEL_SESSION_INFO_*. user_info: keys TARNEL_USER_INFO_* and others.
 * frameworks: texts; the frameworks to check. */
TARNEL_API tarnel_status tarnel_session_set_session_info(tarnel_session* session,
                                                         const tarnel_dictionary* session_info,
                                                         const tarnel_dictionary* user_info,
                                                         const tarnel_array* frameworks);

/* Lets the daemon build the session's backends. Reply: names (none: no configuration was to be had). It may
 * take the daemon 15 s and more to answer. */
TARNEL_API tarnel_status tarnel_session_start_config(tarnel_session* session, tarnel_completion completion,
                                                     void* context);
TARNEL_API tarnel_status tarnel_session_start_config_and_wait(tarnel_session* session, uint32_t timeout_ms,
                                                              tarnel_reply** reply);

/* Gives new user info and asks which backends are live. Reply: names. */
TARNEL_API tarnel_status tarnel_session_fetch_states(tarnel_session* session,
                                                     const tarnel_dictionary* user_info,
                                                     tarnel_completion completion, void* context);
TARNEL_API tarnel_status tarnel_session_fetch_states_and_wait(tarnel_session* session,
                                                              const tarnel_dictionary* user_info,
                                                              uint32_t timeout_ms, tarnel_reply** reply);

/* Where people can look at the session's reports. Reply: text. */
TARNEL_API tarnel_status tarnel_session_fetch_display_url(tarnel_session* session,
                                                          tarnel_completion completion, void* context);
TARNEL_API tarnel_status tarnel_session_fetch_display_url_and_wait(tarnel_session* session,
                                                                   uint32_t timeout_ms, tarnel_reply** reply);

/* Sends a message. Messages that wait together travel together.
 * flags: TARNEL_FLAG_*, 0 to 3. Reply: text of what was posted, or error, or neither. */
TARNEL_API tarnel_status tarnel_session_send_message(tarnel_session* session, uint16_t category,
                                                     uint16_t type, tarnel_flag flags,
                                                     const tarnel_dictionary* payload,
                                                     tarnel_completion completion, void* context);
TARNEL_API tarnel_status tarnel_session_send_message_and_wait(tarnel_session* session, uint16_t category,
                                                              uint16_t type, tarnel_flag flags,
                                                              const tarnel_dictionary* payload,
                                                              uint32_t timeout_ms, tarnel_reply** reply);

/* Sends a message given as one dictionary with the keys TARNEL_MESSAGE_PARAMETERS_*, as it stands.
 * message: not NULL. Reply as above. */
TARNEL_API tarnel_status tarnel_session_send_message_dictionary(tarnel_session* session,
                                                                const tarnel_dictionary* message,
                                                                tarnel_completion completion, void* context);
TARNEL_API tarnel_status tarnel_session_send_message_dictionary_and_wait(tarnel_session* session,
                                                                         const tarnel_dictionary* message,
                                                                         uint32_t timeout_ms,
                                                                         tarnel_reply** reply);

/* Lets every backend deliver what it holds. Reply: text, or error, or both. */
TARNEL_API tarnel_status tarnel_session_flush(tarnel_session* session, tarnel_completion completion,
                                              void* context);
TARNEL_API tarnel_status tarnel_session_flush_and_wait(tarnel_session* session, uint32_t timeout_ms,
                                                       tarnel_reply** reply);

/* The client's last message. Reply as for a message. */
TARNEL_API tarnel_status tarnel_session_finish(tarnel_session* session, tarnel_completion completion,
                                               void* context);
TARNEL_API tarnel_status tarnel_session_finish_and_wait(tarnel_session* session, uint32_t timeout_ms,
                                                        tarnel_reply** reply);

/* Uploads a file to the server that the session's configuration names, compressed; the session is configured
 * before. path: not NULL; absolute, or taken from the working directory at the time of the call. It must be a
 * regular file that this process may read; a symbolic link is not followed.
 * The file is opened here and read by the daemon through what was opened; a process has at most 64 open for
 * uploads. When the server takes it the library deletes it, before the completion runs: unless another
 * file stands at the path by then, it was changed meanwhile, or this process may not delete it.
 * Reply: success: a request was made and has ended, whatever came of it; whether the file is gone says what
 * became of it. The answer takes as long as the upload, whatever reply_timeout_ms says; other calls of the
 * session wait meanwhile, but no other session's. A file above the daemon's limit, or for which it has no
 * room, is refused: success is false.
 * TARNEL_ERROR_FILE: the file cannot be opened, or is no regular file. TARNEL_ERROR_QUEUE_FULL: also when too
 * many are open. */
TARNEL_API tarnel_status tarnel_session_upload_file(tarnel_session* session, const char* path,
                                                    tarnel_completion completion, void* context);
TARNEL_API tarnel_status tarnel_session_upload_file_and_wait(tarnel_session* session, const char* path,
                                                             uint32_t timeout_ms, tarnel_reply** reply);

/* Uploads log records. log_data: not NULL. Reply: success, error. The answer takes as long as the upload, as
 * that of a file. */
TARNEL_API tarnel_status tarnel_session_upload_log_data(tarnel_session* session, const tarnel_array* log_data,
                                                        tarnel_completion completion, void* context);
TARNEL_API tarnel_status tarnel_session_upload_log_data_and_wait(tarnel_session* session,
                                                                 const tarnel_array* log_data,
                                                                 uint32_t timeout_ms, tarnel_reply** reply);

/* Sends one message with its own session info, on a session that needs no configuring.
 * session_info: client type and session identifier are mandatory.
 * Reply: text, "finished" (which does not mean that a backend took it) or "storebag not available".
 * TARNEL_ERROR_NO_REPLY: session_info lacks one of the two, and nothing was sent. */
TARNEL_API tarnel_status tarnel_session_send_single_message(tarnel_session* session,
                                                            const tarnel_dictionary* session_info,
                                                            const tarnel_dictionary* user_info,
                                                            uint16_t category, uint16_t type,
                                                            const tarnel_dictionary* payload,
                                                            tarnel_completion completion, void* context);
TARNEL_API tarnel_status tarnel_session_send_single_message_and_wait(
    tarnel_session* session, const tarnel_dictionary* session_info, const tarnel_dictionary* user_info,
    uint16_t category, uint16_t type, const tarnel_dictionary* payload, uint32_t timeout_ms,
    tarnel_reply** reply);

#ifdef __cplusplus
}
#endif

#endif
