#include "ramdump/boot_entry.h"

#include <string.h>

#include "platform/log.h"

bool is_enable_full(int argc, char** argv) {
  // Comparing one byte past each word takes in the terminating NUL: no prefix matches.
  return argc == 3 && strncmp(argv[1], "enable", 7) == 0 && strncmp(argv[2], "full", 5) == 0;
}

int run_enable_full(uint32_t) {
  RB_LOGE("the automatic ramdump cycle is not available in this build\n");
  return -1;
}

int run_auto_mode(const ramdump_options&) {
  RB_LOGE("the automatic ramdump cycle is not available in this build\n");
  return -1;
}
