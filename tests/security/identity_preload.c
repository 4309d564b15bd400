// Loaded into a program against its will.
#include <unistd.h>

__attribute__((constructor)) static void announce(void) {
  static const char text[] = "preloaded\n";
  if (write(STDOUT_FILENO, text, sizeof text - 1) < 0) _exit(1);
}
