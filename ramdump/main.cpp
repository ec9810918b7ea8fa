// reserveblocks: reserves a file on /data whose blocks the boot firmware fills with a RAM
// dump after a crash, collects the dump at the next boot and switches the feature.
#include <stdlib.h>
#include <sys/stat.h>
#include <time.h>

#include "platform/log.h"
#include "ramdump/boot_entry.h"
#include "ramdump/conversion.h"
#include "ramdump/options.h"
#include "ramdump/switch_modes.h"

int main(int argc, char** argv) {
  // Every mode given to a created file or directory is meant exactly.
  umask(0);
  srand(static_cast<unsigned>(time(nullptr)));
  uint32_t random_crc = static_cast<uint32_t>(rand());
  platform_init_logging();

  if (is_enable_full(argc, argv)) return run_enable_full(random_crc);

  ramdump_options options;
  int rc = parse_options(argc, argv, random_crc, &options);
  if (rc != 0) return rc;
  // One mode runs; a higher one hides the lower ones.
  if (options.status) return ramdump_status_mode();
  if (options.enable) return ramdump_enable_mode();
  if (options.disable) return ramdump_disable_mode();
  if (options.auto_mode) return run_auto_mode(options);
  return run_conversion(options, argv[0]);
}
