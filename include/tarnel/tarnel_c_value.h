#ifndef TARNEL_TARNEL_C_VALUE_H_
#define TARNEL_TARNEL_C_VALUE_H_

/* Dictionaries and arrays of the C interface of libtarnel: what session info, user info and payloads are
 * made of.
 *
 * A dictionary maps text keys to values and keeps their order; an array is a list of values. A value is a
 * boolean, a 64-bit integer, a double, a date, a text, bytes, an array or a dictionary.
 *
 * Copying is cheap: copies share their contents until one of them is changed. What is handed to a call is
 * copied so, and may be changed or destroyed as soon as the call returned.
 *
 * Texts are checked when they are sent, not here: a message with a text or key that is not UTF-8 is refused
 * with TARNEL_ERROR_INVALID_ARGUMENT.
 *
 * Threads: one object is used by one thread at a time. */

#include "tarnel/tarnel_c_types.h"

#ifdef __cplusplus
extern "C" {
#endif

typedef struct tarnel_dictionary tarnel_dictionary;
typedef struct tarnel_array tarnel_array;
/* A value inside a dictionary or array. Always borrowed: it lives as long as what holds it is not changed. */
typedef struct tarnel_value tarnel_value;

typedef enum tarnel_type {
  TARNEL_TYPE_NULL = 0,
  TARNEL_TYPE_BOOLEAN = 1,
  TARNEL_TYPE_INTEGER = 2,          /* fits a signed 64-bit integer */
  TARNEL_TYPE_UNSIGNED_INTEGER = 3, /* does not */
  TARNEL_TYPE_REAL = 4,
  TARNEL_TYPE_DATE = 5,
  TARNEL_TYPE_STRING = 6,
  TARNEL_TYPE_DATA = 7,
  TARNEL_TYPE_ARRAY = 8,
  TARNEL_TYPE_DICTIONARY = 9
} tarnel_type;

/* As the length of a text: it ends at its NUL. */
#define TARNEL_NUL_TERMINATED ((size_t)-1)

/* An empty dictionary or array, owned by the caller, who destroys it. NULL when memory is short. */
TARNEL_API tarnel_dictionary* tarnel_dictionary_create(void);
TARNEL_API tarnel_array* tarnel_array_create(void);
/* A copy, owned by the caller. NULL when given NULL or when memory is short. */
TARNEL_API tarnel_dictionary* tarnel_dictionary_copy(const tarnel_dictionary* dictionary);
TARNEL_API tarnel_array* tarnel_array_copy(const tarnel_array* array);
/* Only for what create and copy returned. NULL is allowed. */
TARNEL_API void tarnel_dictionary_destroy(tarnel_dictionary* dictionary);
TARNEL_API void tarnel_array_destroy(tarnel_array* array);

/* Each puts a value under the key; a key that exists keeps its place and gets the new value.
 * Return TARNEL_OK, TARNEL_ERROR_INVALID_ARGUMENT for a NULL, or TARNEL_ERROR_SYSTEM when memory is short.
 * seconds: since 1970-01-01 00:00 UTC.
 * length: bytes, or TARNEL_NUL_TERMINATED for a text.
 * bytes: may be NULL when length is 0.
 * value: copied. */
TARNEL_API tarnel_status tarnel_dictionary_set_bool(tarnel_dictionary* dictionary, const char* key,
                                                    bool value);
TARNEL_API tarnel_status tarnel_dictionary_set_int64(tarnel_dictionary* dictionary, const char* key,
                                                     int64_t value);
TARNEL_API tarnel_status tarnel_dictionary_set_uint64(tarnel_dictionary* dictionary, const char* key,
                                                      uint64_t value);
TARNEL_API tarnel_status tarnel_dictionary_set_double(tarnel_dictionary* dictionary, const char* key,
                                                      double value);
TARNEL_API tarnel_status tarnel_dictionary_set_date(tarnel_dictionary* dictionary, const char* key,
                                                    double seconds);
TARNEL_API tarnel_status tarnel_dictionary_set_string(tarnel_dictionary* dictionary, const char* key,
                                                      const char* text, size_t length);
TARNEL_API tarnel_status tarnel_dictionary_set_data(tarnel_dictionary* dictionary, const char* key,
                                                    const void* bytes, size_t length);
TARNEL_API tarnel_status tarnel_dictionary_set_array(tarnel_dictionary* dictionary, const char* key,
                                                     const tarnel_array* value);
TARNEL_API tarnel_status tarnel_dictionary_set_dictionary(tarnel_dictionary* dictionary, const char* key,
                                                          const tarnel_dictionary* value);
TARNEL_API tarnel_status tarnel_dictionary_set_value(tarnel_dictionary* dictionary, const char* key,
                                                     const tarnel_value* value);
/* True when the key was there. */
TARNEL_API bool tarnel_dictionary_remove(tarnel_dictionary* dictionary, const char* key);

/* Each appends a value; arguments and results as above. */
TARNEL_API tarnel_status tarnel_array_append_bool(tarnel_array* array, bool value);
TARNEL_API tarnel_status tarnel_array_append_int64(tarnel_array* array, int64_t value);
TARNEL_API tarnel_status tarnel_array_append_uint64(tarnel_array* array, uint64_t value);
TARNEL_API tarnel_status tarnel_array_append_double(tarnel_array* array, double value);
TARNEL_API tarnel_status tarnel_array_append_date(tarnel_array* array, double seconds);
TARNEL_API tarnel_status tarnel_array_append_string(tarnel_array* array, const char* text, size_t length);
TARNEL_API tarnel_status tarnel_array_append_data(tarnel_array* array, const void* bytes, size_t length);
TARNEL_API tarnel_status tarnel_array_append_array(tarnel_array* array, const tarnel_array* value);
TARNEL_API tarnel_status tarnel_array_append_dictionary(tarnel_array* array, const tarnel_dictionary* value);
TARNEL_API tarnel_status tarnel_array_append_value(tarnel_array* array, const tarnel_value* value);

/* Reading. NULL holds nothing: count 0, no key, no value. */
TARNEL_API size_t tarnel_dictionary_count(const tarnel_dictionary* dictionary);
/* index: 0 to count - 1, in order of insertion; NULL beyond. */
TARNEL_API const char* tarnel_dictionary_key_at(const tarnel_dictionary* dictionary, size_t index);
TARNEL_API const tarnel_value* tarnel_dictionary_value_at(const tarnel_dictionary* dictionary, size_t index);
/* NULL when the key is not there. */
TARNEL_API const tarnel_value* tarnel_dictionary_find(const tarnel_dictionary* dictionary, const char* key);
TARNEL_API size_t tarnel_array_count(const tarnel_array* array);
TARNEL_API const tarnel_value* tarnel_array_value_at(const tarnel_array* array, size_t index);

TARNEL_API tarnel_type tarnel_value_type(const tarnel_value* value);
/* Numbers, with a boolean as 0 or 1: integers keep their low 64 bits, a real is cut toward zero, text is read
 * as the number it begins with; everything else is 0. */
TARNEL_API bool tarnel_value_bool(const tarnel_value* value);
TARNEL_API int64_t tarnel_value_int64(const tarnel_value* value);
TARNEL_API uint64_t tarnel_value_uint64(const tarnel_value* value);
TARNEL_API double tarnel_value_double(const tarnel_value* value);
/* Seconds since 1970 of a date; 0 for every other type. */
TARNEL_API double tarnel_value_date(const tarnel_value* value);
/* The text or bytes and their length in bytes; NULL and 0 for every other type. length: may be NULL. */
TARNEL_API const char* tarnel_value_string(const tarnel_value* value, size_t* length);
TARNEL_API const uint8_t* tarnel_value_data(const tarnel_value* value, size_t* length);
/* NULL for every other type. */
TARNEL_API const tarnel_array* tarnel_value_array(const tarnel_value* value);
TARNEL_API const tarnel_dictionary* tarnel_value_dictionary(const tarnel_value* value);

#ifdef __cplusplus
}
#endif

#endif
