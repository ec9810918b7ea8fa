#include "ramdump/boot_entry.h"

#include <android-base/strings.h>
#include <android-base/unique_fd.h>
#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>

#include "misc/misc_store.h"
#include "platform/log.h"
#include "platform/properties.h"
#include "ramdump/auto_cycle.h"
#include "ramdump/file_ref.h"
#include "ramdump/le_bytes.h"
#include "ramdump/misc_flags.h"
#include "ramdump/ramdump_dir.h"
#include "ramdump/ramdump_names.h"

namespace {

// Publishes the cycle's outcome for the platform: "done" with the output directory, or
// "fail" (which a boot that only armed a new chain also reports).
void publish_cycle_result(int result) {
  if (result == 0) {
    property_set(PROP_NEW_DIRECTORY, RAMDUMP_OUTPUT_DIR);
    property_set(PROP_KVDUMP, "done");
  } else {
    property_set(PROP_KVDUMP, "fail");
  }
}

// The start of the request file, "" when it cannot be opened or read. One read of at most 1024
// bytes, not ReadFileToString: the file is writable by everyone and may be made huge.
std::string read_request() {
  char text[1024];
  android::base::unique_fd fd(
      open_file(in_ramdump_dir(RAMDUMP_STATUS_NAME, RAMDUMP_STATUS_PATH), O_RDONLY));
  ssize_t n = fd < 0 ? -1 : read(fd, text, sizeof(text));
  return n > 0 ? std::string(text, static_cast<size_t>(n)) : std::string();
}

// An empty request file, readable and writable by everyone, lets the platform ask for the
// feature to be switched with a plain write.
void ensure_request_file() {
  const file_ref status = in_ramdump_dir(RAMDUMP_STATUS_NAME, RAMDUMP_STATUS_PATH);
  struct stat st;
  if (stat_file(status, &st) == 0 && !usable_fixed_file(st, RAMDUMP_STATUS_PATH)) return;
  if (status.dir_fd >= 0 && faccessat(status.dir_fd, status.name, R_OK | W_OK, 0) == 0) return;
  android::base::unique_fd fd(open_file(status, O_RDWR | O_CREAT, 0666));
  if (fd < 0) {
    RB_LOGE("Could not create file %s: %s\n", RAMDUMP_STATUS_PATH, strerror(errno));
    return;
  }
  if (fchmod(fd, 0666) != 0) {
    RB_LOGE("Could not chmod %s: %s\n", RAMDUMP_STATUS_PATH, strerror(errno));
  }
}

// Applies a "disable" or "enable" request; -1 when the misc partition cannot be written.
int apply_request_file() {
  if (android::base::StartsWith(read_request(), "disable")) {
    RB_LOGI("Disabling ramdump\n");
    if (write_disabled_ibh() != 0 || write_enable_flag(RAMDUMP_DISABLED) != 0) {
      RB_LOGE("Failed to disable ramdump\n");
      return -1;
    }
  } else if (android::base::StartsWith(read_request(), "enable")) {
    RB_LOGI("Enabling ramdump\n");
    if (write_enable_flag(RAMDUMP_ENABLED) != 0) {
      RB_LOGE("Failed to enable ramdump\n");
      return -1;
    }
  }
  return 0;
}

// With the feature off, nothing of it may occupy /data.
int delete_ramdump_files() {
  property_set(PROP_KVDUMP, "fail");
  RB_LOGI("Ramdump is disabled, deleting ramdump reserved file: %s\n", RAMDUMP_RESERVED_PATH);
  const int dir = ramdump_dir();
  int rc = dir < 0 ? -1 : unlinkat(dir, RAMDUMP_RESERVED_NAME, 0);
  if (rc != 0) RB_LOGE("Failed to delete %s: %s\n", RAMDUMP_RESERVED_PATH, strerror(errno));
  RB_LOGI("Ramdump is disabled, deleting ramdump output file: %s\n", RAMDUMP_OUTPUT_PATH);
  remove_collected_dump();
  if (dir >= 0) unlinkat(dir, RAMDUMP_OUTPUT_PARENT_NAME, AT_REMOVEDIR);
  return rc == 0 ? 0 : -1;
}

}  // namespace

bool is_enable_full(int argc, char** argv) {
  // Comparing one byte past each word takes in the terminating NUL: no prefix matches.
  return argc == 3 && strncmp(argv[1], "enable", 7) == 0 && strncmp(argv[2], "full", 5) == 0;
}

int run_enable_full(uint32_t initial_crc) {
  if (lock_ramdump_dir() != 0) {
    publish_cycle_result(-1);
    return 0;
  }
  write_enable_flag(RAMDUMP_ENABLED);  // a failure is logged and the cycle runs anyway
  property_set(PROP_KVDUMP, "running");
  publish_cycle_result(process_auto_ramdump(initial_crc, 0));
  return 0;
}

int run_auto_mode(const ramdump_options& options) {
  if (lock_ramdump_dir() != 0) {
    publish_cycle_result(-1);
    return -1;
  }
  uint8_t lba[4];
  put_le32(lba, RAMDUMP_LBA_DISABLED);
  if (MISC_write_RamdumpLBA(lba) != 0) {
    RB_LOGE("error writing ramdump disable lba to MISC partition\n");
  } else if (ramdump_dir() >= 0) {
    unlinkat(ramdump_dir(), RAMDUMP_KVDUMP_NAME, 0);
  }
  ensure_request_file();
  if (apply_request_file() != 0) return -1;
  if (!read_ramdump_enabled()) return delete_ramdump_files();
  property_set(PROP_KVDUMP, "running");
  int result = process_auto_ramdump(options.initial_crc, options.progress ? 1 : 0);
  publish_cycle_result(result);
  return result;
}
