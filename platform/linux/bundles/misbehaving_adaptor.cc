// An adaptor for tests. What it does wrong, ADAPTOR_FAULT says when it is built.

#include <cstdlib>
#include <stdexcept>
#include <string>
#include <string_view>

#include "tarnel/tarnel_adaptor.h"

#define FAULT_NONE 0
#define FAULT_NO_EXPORT 1
#define FAULT_WRONG_VERSION 2
#define FAULT_NO_INSTANCE 3
#define FAULT_NO_METHODS 4
#define FAULT_THROWING 5
#define FAULT_INCOMPLETE 6

namespace {

int object = 0;

void* create() {
  if (ADAPTOR_FAULT == FAULT_THROWING) throw std::runtime_error("no instance today");
  return ADAPTOR_FAULT == FAULT_NO_INSTANCE ? nullptr : &object;
}

void* createForThrowing() {
  return &object;
}

void destroy(void* /*instance*/) {
  if (ADAPTOR_FAULT == FAULT_THROWING) throw 5;
}

void sendMessage(void* /*instance*/, uint16_t /*method*/, uint16_t /*respCode*/,
                 const tarnel_dictionary* /*dict*/) {
  if (ADAPTOR_FAULT == FAULT_THROWING) throw std::runtime_error("not this one");
}

tarnel_adaptor_method findMethod(void* /*instance*/, const char* name) {
  if (ADAPTOR_FAULT == FAULT_NO_METHODS) return nullptr;
  if (ADAPTOR_FAULT == FAULT_THROWING && std::string_view(name) == "unheardOf") throw 5;
  return sendMessage;
}

constexpr tarnel_adaptor_class kClass{
    .version = ADAPTOR_FAULT == FAULT_WRONG_VERSION ? TARNEL_ADAPTOR_VERSION + 1 : TARNEL_ADAPTOR_VERSION,
    .create = create,
    .destroy = destroy,
    .find_method = ADAPTOR_FAULT == FAULT_INCOMPLETE ? nullptr : findMethod};

// Makes instances, unlike the other.
constexpr tarnel_adaptor_class kThrowingLater{.version = TARNEL_ADAPTOR_VERSION,
                                              .create = createForThrowing,
                                              .destroy = destroy,
                                              .find_method = findMethod};

[[maybe_unused]] constexpr tarnel_adaptor_class kWithoutCreate{
    .version = TARNEL_ADAPTOR_VERSION, .create = nullptr, .destroy = destroy, .find_method = findMethod};
[[maybe_unused]] constexpr tarnel_adaptor_class kWithoutDestroy{
    .version = TARNEL_ADAPTOR_VERSION, .create = create, .destroy = nullptr, .find_method = findMethod};

}  // namespace

#if ADAPTOR_FAULT != FAULT_NO_EXPORT
const tarnel_adaptor_class* tarnel_adaptor_class_named(uint32_t /*version*/,
                                                       const tarnel_adaptor_values* /*values*/,
                                                       const char* name) {
  if (ADAPTOR_FAULT == FAULT_THROWING && std::string_view(name) == "Nothing")
    throw std::runtime_error("no class");
  if (ADAPTOR_FAULT == FAULT_INCOMPLETE && std::string_view(name) == "WithoutCreate") return &kWithoutCreate;
  if (ADAPTOR_FAULT == FAULT_INCOMPLETE && std::string_view(name) == "WithoutDestroy")
    return &kWithoutDestroy;
  return std::string_view(name) == "ThrowsLater" ? &kThrowingLater : &kClass;
}
#else
// Tells, in the variable MISBEHAVING_ADAPTOR_LOADS, how often the library was loaded.
__attribute__((constructor)) static void countLoads() {
  const char* const before = getenv("MISBEHAVING_ADAPTOR_LOADS");
  setenv("MISBEHAVING_ADAPTOR_LOADS", std::to_string(before == nullptr ? 1 : atoi(before) + 1).c_str(), 1);
}

extern "C" TARNEL_ADAPTOR_EXPORT int tarnel_something_else(void* instance);
int tarnel_something_else(void* instance) {
  static_cast<void>(kClass);
  static_cast<void>(kThrowingLater);
  return instance == nullptr ? 0 : 1;
}
#endif
