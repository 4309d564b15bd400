/* A whole adaptor: keeps what it is handed as lines of a file, one for each message, such as
 *
 *     1 3/4 codec="opus" lossPercent=0.5
 *
 * with the number of its instance, method/respCode, and the payload. The file is named by the variable
 * SAMPLE_ADAPTOR_FILE in the daemon's environment and must lie where the daemon may write, below its state or
 * logs directory. */

/* With -std=c11 the headers of the system show nothing of their own otherwise. */
#define _POSIX_C_SOURCE 200809L

#include <fcntl.h>
#include <inttypes.h>
#include <stdatomic.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <tarnel/tarnel_adaptor.h>
#include <unistd.h>

struct adaptor {
  unsigned number;
  int file;
};

/* Written once, before any instance exists. */
static const tarnel_adaptor_values* values;
static atomic_uint instances;

static void write_value(FILE* line, const tarnel_value* value);

static void write_entries(FILE* line, const tarnel_dictionary* dictionary) {
  for (size_t index = 0; index < values->dictionary_count(dictionary); ++index) {
    fprintf(line, " %s=", values->dictionary_key_at(dictionary, index));
    write_value(line, values->dictionary_value_at(dictionary, index));
  }
}

static void write_data(FILE* line, const tarnel_value* value) {
  size_t length = 0;
  const uint8_t* bytes = values->value_data(value, &length);
  for (size_t index = 0; index < length; ++index) fprintf(line, "%02x", bytes[index]);
}

static void write_array(FILE* line, const tarnel_array* array) {
  fputc('[', line);
  for (size_t index = 0; index < values->array_count(array); ++index) {
    if (index != 0) fputc(',', line);
    write_value(line, values->array_value_at(array, index));
  }
  fputc(']', line);
}

static void write_value(FILE* line, const tarnel_value* value) {
  switch (values->value_type(value)) {
    case TARNEL_TYPE_BOOLEAN:
      fputs(values->value_bool(value) ? "true" : "false", line);
      break;
    case TARNEL_TYPE_INTEGER:
      fprintf(line, "%" PRId64, values->value_int64(value));
      break;
    case TARNEL_TYPE_UNSIGNED_INTEGER:
      fprintf(line, "%" PRIu64, values->value_uint64(value));
      break;
    case TARNEL_TYPE_REAL:
      fprintf(line, "%g", values->value_double(value));
      break;
    case TARNEL_TYPE_DATE:
      fprintf(line, "@%.3f", values->value_date(value));
      break;
    case TARNEL_TYPE_STRING:
      fprintf(line, "\"%s\"", values->value_string(value, NULL));
      break;
    case TARNEL_TYPE_DATA:
      write_data(line, value);
      break;
    case TARNEL_TYPE_ARRAY:
      write_array(line, values->value_array(value));
      break;
    case TARNEL_TYPE_DICTIONARY:
      fputc('{', line);
      write_entries(line, values->value_dictionary(value));
      fputs(" }", line);
      break;
    default:
      fputs("null", line);
  }
}

/* Everything of the payload is copied before it returns: afterwards the payload is gone. */
static void send_message(void* instance, uint16_t method, uint16_t resp_code, const tarnel_dictionary* dict) {
  const struct adaptor* self = instance;
  char* text = NULL;
  size_t length = 0;
  FILE* line = open_memstream(&text, &length);
  if (line == NULL) return;
  fprintf(line, "%u %u/%u", self->number, method, resp_code);
  if (dict == NULL) fputs(" no payload", line);
  write_entries(line, dict);
  fputc('\n', line);
  fclose(line);
  /* One write for each line, so that those of other instances do not come between. */
  if (self->file >= 0 && write(self->file, text, length) < 0) perror("sample adaptor");
  free(text);
}

static void* create(void) {
  struct adaptor* self = malloc(sizeof *self);
  const char* path = getenv("SAMPLE_ADAPTOR_FILE");
  if (self == NULL) return NULL;
  self->number = atomic_fetch_add(&instances, 1) + 1;
  self->file = path == NULL ? -1 : open(path, O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0600);
  return self;
}

static void destroy(void* instance) {
  struct adaptor* self = instance;
  if (self->file >= 0) close(self->file);
  free(self);
}

static tarnel_adaptor_method find_method(void* instance, const char* name) {
  (void)instance;
  return strcmp(name, "sendMessageWithMethod:respCode:dict:") == 0 ? send_message : NULL;
}

const tarnel_adaptor_class* tarnel_adaptor_class_named(uint32_t version, const tarnel_adaptor_values* table,
                                                       const char* name) {
  static const tarnel_adaptor_class dravik_adaptor = {
      .version = TARNEL_ADAPTOR_VERSION, .create = create, .destroy = destroy, .find_method = find_method};
  if (version != TARNEL_ADAPTOR_VERSION || strcmp(name, "DravikAdaptor") != 0) return NULL;
  if (values == NULL) values = table;
  return &dravik_adaptor;
}
