#include "ramdump/boot_entry.h"

#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include "misc/misc_store.h"
#include "platform/log.h"
#include "platform/properties.h"
#include "ramdump/auto_cycle.h"
#include "ramdump/le_bytes.h"
#include "ramdump/misc_flags.h"
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

// Reads the start of the request file into a zeroed buffer; false when it cannot be opened
// or read.
bool read_request(char (&text)[1024]) {
  memset(text, 0, sizeof(text));
  int fd = open(RAMDUMP_STATUS_PATH, O_RDONLY | O_CLOEXEC);
  if (fd < 0) return false;
  ssize_t n = read(fd, text, sizeof(text));
  close(fd);
  return n >= 0;
}

// An empty request file, readable and writable by everyone, lets the platform ask for the
// feature to be switched with a plain write.
void ensure_request_file() {
  if (access(RAMDUMP_STATUS_PATH, R_OK | W_OK) == 0) return;
  int fd = open(RAMDUMP_STATUS_PATH, O_RDWR | O_CREAT | O_CLOEXEC, 0666);
  if (fd < 0) {
    RB_LOGE("Could not create file %s: %s\n", RAMDUMP_STATUS_PATH, strerror(errno));
    return;
  }
  if (fchmod(fd, 0666) != 0) {
    RB_LOGE("Could not chmod %s: %s\n", RAMDUMP_STATUS_PATH, strerror(errno));
  }
  close(fd);
}

// Applies a "disable" or "enable" request; -1 when the misc partition cannot be written.
int apply_request_file() {
  char text[1024];
  if (read_request(text) && strncmp(text, "disable", 7) == 0) {
    RB_LOGI("Disabling ramdump\n");
    if (write_disabled_ibh() != 0 || write_enable_flag(RAMDUMP_DISABLED) != 0) {
      RB_LOGE("Failed to disable ramdump\n");
      return -1;
    }
  } else if (read_request(text) && strncmp(text, "enable", 6) == 0) {
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
  int rc = unlink(RAMDUMP_RESERVED_PATH);
  if (rc != 0) RB_LOGE("Failed to delete %s: %s\n", RAMDUMP_RESERVED_PATH, strerror(errno));
  RB_LOGI("Ramdump is disabled, deleting ramdump output file: %s\n", RAMDUMP_OUTPUT_PATH);
  unlink(RAMDUMP_OUTPUT_PATH);
  unlink(RAMDUMP_MSG_PATH);
  rmdir(RAMDUMP_OUTPUT_DIR);
  rmdir(RAMDUMP_OUTPUT_PARENT);
  return rc == 0 ? 0 : -1;
}

}  // namespace

bool is_enable_full(int argc, char** argv) {
  // Comparing one byte past each word takes in the terminating NUL: no prefix matches.
  return argc == 3 && strncmp(argv[1], "enable", 7) == 0 && strncmp(argv[2], "full", 5) == 0;
}

int run_enable_full(uint32_t initial_crc) {
  write_enable_flag(RAMDUMP_ENABLED);  // a failure is logged and the cycle runs anyway
  property_set(PROP_KVDUMP, "running");
  publish_cycle_result(process_auto_ramdump(initial_crc, 0));
  return 0;
}

int run_auto_mode(const ramdump_options& options) {
  uint8_t lba[4];
  put_le32(lba, RAMDUMP_LBA_DISABLED);
  if (MISC_write_RamdumpLBA(lba) != 0) {
    RB_LOGE("error writing ramdump disable lba to MISC partition\n");
  } else {
    unlink(RAMDUMP_KVDUMP_PATH);
  }
  ensure_request_file();
  if (apply_request_file() != 0) return -1;
  if (!read_ramdump_enabled()) return delete_ramdump_files();
  property_set(PROP_KVDUMP, "running");
  int result = process_auto_ramdump(options.initial_crc, options.progress ? 1 : 0);
  publish_cycle_result(result);
  return result;
}
