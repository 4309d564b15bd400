#ifndef TARNEL_TARNEL_ADAPTOR_H_
#define TARNEL_TARNEL_ADAPTOR_H_

/* For who writes an adaptor: code that the Tarnel daemon loads from a bundle and hands messages to.
 *
 * A bundle is a folder whose library has the folder's name without its ending:
 *
 *     QMXPerformance.framework/QMXPerformance.so
 *
 * The library exports one C function, tarnel_adaptor_class_named. The daemon asks it for a class by name,
 * makes an instance of that class for each of its sessions, and calls the instance's methods by name. An
 * adaptor links against nothing of Tarnel: what it needs of the daemon, it is given in a table of functions.
 * Of tarnel_c_value.h, which this header includes, it uses the types alone; the functions of that header are
 * those of libtarnel, and another thing.
 *
 * Threads
 * - tarnel_adaptor_class_named is called by one thread at a time.
 * - create, find_method, the methods and destroy of one instance are called by one thread at a time, in the
 *   order in which things happened, though not always by the same thread.
 * - There is an instance for each session, and one for each message that is sent without a session; different
 *   instances are called on different threads at the same time: what instances share, the adaptor guards.
 * - A call that takes long delays its own session's client, and nobody else; only tarnel_adaptor_class_named,
 *   and what runs when the library is loaded, delay all sessions that want an instance meanwhile.
 *
 * Lifetime
 * - What a method is given (the dictionary and all that is read out of it: keys, texts, bytes, values) is
 * valid until the method returns, and is not to be changed. Copy what is to stay.
 * - The table of functions is valid for ever, on any thread.
 * - An instance is destroyed exactly once, after its last call has returned and before its session is gone.
 * - The library is never unloaded, nor loaded a second time, as long as the daemon runs. A new one counts
 * after a restart.
 *
 * What else holds
 * - Nothing may be thrown out of a function that the daemon calls. What is thrown nevertheless is caught and
 *   logged, and the message counts as handed over.
 * - The daemon is confined, and so is the adaptor: it starts no programs and no processes, reads what the
 *   daemon may read and writes into the daemon's own directories.
 * - Nobody but root and the daemon's own user may be able to write to the library, the bundle or any folder
 * above them, and none of these may be a symbolic link; else the bundle is refused, and the daemon's log says
 * why. */

#include "tarnel/tarnel_c_value.h"

#ifdef __cplusplus
extern "C" {
#endif

/* The version of this interface. It grows when something changes that an adaptor must know. */
#define TARNEL_ADAPTOR_VERSION 1

#if defined(__GNUC__)
#define TARNEL_ADAPTOR_EXPORT __attribute__((visibility("default")))
#else
#define TARNEL_ADAPTOR_EXPORT
#endif

/* Reading dictionaries, arrays and values. The rules are those of the functions of the same names in
 * tarnel_c_value.h: NULL holds nothing, a value of another type reads as 0 or NULL, numbers are converted.
 * Use nothing that lies beyond `size`. */
typedef struct tarnel_adaptor_values {
  size_t size;
  /* Number of entries; key and value of each, 0 to count - 1, in order; NULL beyond. */
  size_t (*dictionary_count)(const tarnel_dictionary* dictionary);
  const char* (*dictionary_key_at)(const tarnel_dictionary* dictionary, size_t index);
  const tarnel_value* (*dictionary_value_at)(const tarnel_dictionary* dictionary, size_t index);
  /* NULL when the key is not there. */
  const tarnel_value* (*dictionary_find)(const tarnel_dictionary* dictionary, const char* key);
  size_t (*array_count)(const tarnel_array* array);
  const tarnel_value* (*array_value_at)(const tarnel_array* array, size_t index);
  tarnel_type (*value_type)(const tarnel_value* value);
  /* Numbers, with a boolean as 0 or 1. */
  bool (*value_bool)(const tarnel_value* value);
  int64_t (*value_int64)(const tarnel_value* value);
  uint64_t (*value_uint64)(const tarnel_value* value);
  double (*value_double)(const tarnel_value* value);
  /* Seconds since 1970-01-01 00:00 UTC of a date. */
  double (*value_date)(const tarnel_value* value);
  /* Text in UTF-8, which ends with NUL, and bytes; length in bytes, may be NULL. */
  const char* (*value_string)(const tarnel_value* value, size_t* length);
  const uint8_t* (*value_data)(const tarnel_value* value, size_t* length);
  const tarnel_array* (*value_array)(const tarnel_value* value);
  const tarnel_dictionary* (*value_dictionary)(const tarnel_value* value);
} tarnel_adaptor_values;

/* A method. The daemon knows one, "sendMessageWithMethod:respCode:dict:", which takes a message: its method
 * (the category that its client gave, 0 to 65535), its respCode (the type, 0 to 65535) and its payload, which
 * is NULL when the message has none. */
typedef void (*tarnel_adaptor_method)(void* instance, uint16_t method, uint16_t resp_code,
                                      const tarnel_dictionary* dict);

/* A class. It and what it points to stay as they are for ever. */
typedef struct tarnel_adaptor_class {
  /* TARNEL_ADAPTOR_VERSION of the header that the adaptor was built with. The daemon refuses another version
   * than its own. */
  uint32_t version;
  /* A new instance, or NULL when there can be none; the daemon then goes on without. */
  void* (*create)(void);
  /* Ends an instance that create returned. */
  void (*destroy)(void* instance);
  /* The instance's method of that name; NULL when it does not respond to it. Asked before every call. */
  tarnel_adaptor_method (*find_method)(void* instance, const char* name);
} tarnel_adaptor_class;

/* What the library exports, under this name.
 * version: the daemon's TARNEL_ADAPTOR_VERSION; an adaptor that cannot serve it returns NULL.
 * values: the table with which dictionaries are read; keep the pointer.
 * name: the class that is wanted, "DravikAdaptor".
 * Returns the class; NULL when the library has none of that name. */
TARNEL_ADAPTOR_EXPORT const tarnel_adaptor_class* tarnel_adaptor_class_named(
    uint32_t version, const tarnel_adaptor_values* values, const char* name);

#ifdef __cplusplus
}
#endif

#endif
