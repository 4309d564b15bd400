/* An adaptor for tests, which watches how it is called; probe_count tells what it saw. */

#define _POSIX_C_SOURCE 200809L

#include <pthread.h>
#include <sched.h>
#include <stdatomic.h>
#include <stdlib.h>
#include <string.h>
#include <tarnel/tarnel_adaptor.h>
#include <time.h>

TARNEL_ADAPTOR_EXPORT int probe_count(const char* what);

struct instance {
  atomic_int callers;
};

static const tarnel_adaptor_values* values;
static atomic_int lookups, lookups_at_once;
static atomic_int created, destroyed, overlaps;

static pthread_mutex_t mutex = PTHREAD_MUTEX_INITIALIZER;
static pthread_cond_t changed = PTHREAD_COND_INITIALIZER;
static int waiting, met; /* guarded by mutex */

static void enter(struct instance* self) {
  if (atomic_fetch_add(&self->callers, 1) != 0) atomic_fetch_add(&overlaps, 1);
}

/* Returns when another instance's call is here too, or after a while. */
static void meet(void) {
  struct timespec latest;
  clock_gettime(CLOCK_REALTIME, &latest);
  latest.tv_sec += 20;
  pthread_mutex_lock(&mutex);
  ++waiting;
  pthread_cond_broadcast(&changed);
  while (waiting < 2 && pthread_cond_timedwait(&changed, &mutex, &latest) == 0) continue;
  if (waiting >= 2) ++met;
  pthread_mutex_unlock(&mutex);
}

static void send_message(void* instance, uint16_t method, uint16_t resp_code, const tarnel_dictionary* dict) {
  struct instance* self = instance;
  (void)method;
  (void)resp_code;
  enter(self);
  if (values->dictionary_find(dict, "meet") != NULL) meet();
  atomic_fetch_sub(&self->callers, 1);
}

static void* create(void) {
  atomic_fetch_add(&created, 1);
  return calloc(1, sizeof(struct instance));
}

static void destroy(void* instance) {
  enter(instance);
  atomic_fetch_add(&destroyed, 1);
  free(instance);
}

static tarnel_adaptor_method find_method(void* instance, const char* name) {
  struct instance* self = instance;
  enter(self);
  atomic_fetch_sub(&self->callers, 1);
  return strcmp(name, "sendMessageWithMethod:respCode:dict:") == 0 ? send_message : NULL;
}

const tarnel_adaptor_class* tarnel_adaptor_class_named(uint32_t version, const tarnel_adaptor_values* table,
                                                       const char* name) {
  static const tarnel_adaptor_class adaptor = {
      .version = TARNEL_ADAPTOR_VERSION, .create = create, .destroy = destroy, .find_method = find_method};
  const int at_once = atomic_fetch_add(&lookups, 1) + 1;
  if (at_once > atomic_load(&lookups_at_once)) atomic_store(&lookups_at_once, at_once);
  sched_yield(); /* a good moment for another thread, were one let in */
  values = table;
  atomic_fetch_sub(&lookups, 1);
  return version == TARNEL_ADAPTOR_VERSION && strcmp(name, "DravikAdaptor") == 0 ? &adaptor : NULL;
}

int probe_count(const char* what) {
  int count = 0;
  if (strcmp(what, "lookups at once") == 0) return atomic_load(&lookups_at_once);
  if (strcmp(what, "created") == 0) return atomic_load(&created);
  if (strcmp(what, "destroyed") == 0) return atomic_load(&destroyed);
  if (strcmp(what, "overlaps") == 0) return atomic_load(&overlaps);
  pthread_mutex_lock(&mutex);
  count = met;
  pthread_mutex_unlock(&mutex);
  return count;
}
