#ifndef TARNEL_TARNEL_C_TYPES_H_
#define TARNEL_TARNEL_C_TYPES_H_

/* Status codes, replies and texts of the C interface of libtarnel.
 *
 * The C interface is the library's binary interface. Its rules, which hold for every function:
 * - Handles are opaque. Structs that cross the interface begin with `size`; what a caller's struct is too
 *   short for keeps its default, what the library's struct is too short for is ignored.
 * - Text is UTF-8, ends with NUL, and is copied when it comes in.
 * - No function throws, raises a signal or ends the process. */

#include <stdbool.h>
#include <stddef.h>
#include <stdint.h>

#if defined(__GNUC__)
#define TARNEL_API __attribute__((visibility("default")))
#else
#define TARNEL_API
#endif

#ifdef __cplusplus
extern "C" {
#endif

/* What became of a call. The numbers never change. */
typedef int32_t tarnel_status;
enum {
  TARNEL_OK = 0,
  /* An argument is missing, out of its range, not UTF-8, or nested deeper than 32 levels. */
  TARNEL_ERROR_INVALID_ARGUMENT = 1,
  /* The call would not fit into a frame of 1 MiB (1,048,576 bytes), or gives a session more than 64 KiB
   * (65,536 bytes) of session info and user info to keep. */
  TARNEL_ERROR_TOO_LARGE = 2,
  /* The queue holds as many calls or bytes as it may: wait for answers, or drop the message. */
  TARNEL_ERROR_QUEUE_FULL = 3,
  /* Nothing listens at the socket. */
  TARNEL_ERROR_NO_DAEMON = 4,
  /* The daemon, or the socket's permissions, do not let this process in. */
  TARNEL_ERROR_REFUSED = 5,
  /* The connection was lost before the answer came; the daemon may or may not have seen the call. */
  TARNEL_ERROR_INTERRUPTED = 6,
  /* The session was destroyed, or the process is ending. */
  TARNEL_ERROR_CLOSED = 7,
  /* No answer within the time given. */
  TARNEL_ERROR_TIMED_OUT = 8,
  /* The daemon says that it will not answer this call. */
  TARNEL_ERROR_NO_REPLY = 9,
  /* The daemon did not accept the call; the message says why. */
  TARNEL_ERROR_DAEMON = 10,
  /* The daemon's answer could not be understood. */
  TARNEL_ERROR_PROTOCOL = 11,
  /* A waiting call was made from one of the session's own callbacks: it would wait for itself. */
  TARNEL_ERROR_WRONG_THREAD = 12,
  /* The session was made before fork() and this is the child: make a new one. */
  TARNEL_ERROR_FORKED = 13,
  /* The system gave no thread, descriptor or memory. */
  TARNEL_ERROR_SYSTEM = 14,
  /* The file to upload cannot be opened for reading, or is no regular file. */
  TARNEL_ERROR_FILE = 15
};

/* The constant's name ("TARNEL_ERROR_QUEUE_FULL"), or "unknown". Never NULL; valid for ever.
 * Threads: any. */
TARNEL_API const char* tarnel_status_name(tarnel_status status);

/* Why the calling thread's last failed call failed: one sentence that names the remedy. "" when none has
 * failed. Valid until the same thread's next call of this library.
 * Threads: any; each has its own text. */
TARNEL_API const char* tarnel_last_error(void);

/* The library's version, "1.0.0". Threads: any. */
TARNEL_API const char* tarnel_version(void);

/* The answer to one call. Which of the middle fields are used is said at each call; the others are empty. */
typedef struct tarnel_reply {
  size_t size;
  /* TARNEL_OK when the daemon answered, whatever it answered; else why there is no answer. */
  tarnel_status status;
  /* One sentence when status is not TARNEL_OK, else "". Never NULL. */
  const char* message;
  /* Names of the live backends; NULL when the daemon gave none at all (count 0 with a non-NULL pointer is an
   * empty list). */
  const char* const* names;
  size_t name_count;
  /* NULL when there is none. */
  const char* text;
  bool success;
  /* What a backend reported: error_domain is NULL when there is no error. */
  const char* error_domain;
  int64_t error_code;
  const char* error_description;
} tarnel_reply;

/* Called exactly once for each call that was accepted (that returned TARNEL_OK), on the session's I/O
 * thread: with the answer, or with the reason why none comes. Never called for a call that was not accepted,
 * after the process began to end, or in a forked child.
 * reply: valid during the callback only.
 * It may make further calls of the session, and destroy it, but must not wait on it, throw or block for
 * long: meanwhile no other answer is handled. */
typedef void (*tarnel_completion)(void* context, const tarnel_reply* reply);

/* Frees a reply that a waiting call handed out. NULL is allowed. Threads: any. */
TARNEL_API void tarnel_reply_destroy(tarnel_reply* reply);

#ifdef __cplusplus
}
#endif

#endif
