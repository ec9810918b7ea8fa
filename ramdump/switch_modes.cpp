#include "ramdump/switch_modes.h"

#include <stdio.h>

#include "misc/misc_store.h"
#include "platform/log.h"
#include "ramdump/le_bytes.h"
#include "ramdump/misc_flags.h"
#include "ramdump/ramdump_dir.h"
#include "ramdump/ramdump_names.h"

bool print_ramdump_status() {
  bool enabled = read_ramdump_enabled();
  puts(enabled ? "Ramdump enabled" : "Ramdump disabled");
  return enabled;
}

int ramdump_status_mode() {
  print_ramdump_status();
  return 0;
}

// The boot-time run's lock: a switch in the middle of its cycle would leave the misc items
// disagreeing with each other.
int ramdump_enable_mode() {
  if (lock_ramdump_dir() != 0) return 1;
  if (write_enable_flag(RAMDUMP_ENABLED) != 0) {
    RB_LOGE("failed to enable ramdump\n");
    return 1;
  }
  print_ramdump_status();
  return 0;
}

int ramdump_disable_mode() {
  if (lock_ramdump_dir() != 0) return 1;
  if (write_disabled_ibh() != 0 || write_enable_flag(RAMDUMP_DISABLED) != 0) {
    RB_LOGE("failed to disable ramdump\n");
    return 1;
  }
  print_ramdump_status();
  return 0;
}
