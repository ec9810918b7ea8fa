#include "ramdump/conversion.h"

#include <errno.h>
#include <limits.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include "fs_mgr/fs_mgr_fstab.h"
#include "platform/log.h"
#include "ramdump/arming.h"
#include "ramdump/block_device.h"
#include "ramdump/chain_check.h"
#include "ramdump/file_ref.h"
#include "ramdump/ramdump_dir.h"
#include "ramdump/read_out.h"
#include "ramdump/usage.h"

int run_conversion(const ramdump_options& options, const char* program) {
  // Without an operand the run goes on and fails at the first step that needs the path.
  const char* path = options.block_file;
  if (path == nullptr) print_usage(program);
  // The reserved file is the boot-time run's: one run at a time works on it.
  if (is_reserved_file(path) && lock_ramdump_dir() != 0) return -1;
  if (options.create) {
    int rc =
        create_file(typed_path(path), static_cast<int64_t>(options.create_size), options.progress);
    if (rc < 0) return rc;
  }
  char absolute[PATH_MAX];
  if (path == nullptr) errno = EINVAL;
  if (path == nullptr || realpath(path, absolute) == nullptr) {
    RB_LOGE("failed to convert %s to absolute path: %s", path != nullptr ? path : "(null)",
            strerror(errno));
    return 1;
  }
  // The table stays loaded until exit: the device path points into it.
  fstab* table = nullptr;
  const char* blk_dev = nullptr;
  int encryptable = 0;
  int encrypted = 0;
  if (resolve_block_device(absolute, &table, &blk_dev, &encryptable, &encrypted) != 0) return 1;
  RB_LOGI("  block dev: %s\n", blk_dev);
  RB_LOGI("encryptable: %s\n", encryptable ? "yes" : "no");
  RB_LOGI("  encrypted: %s\n", encrypted ? "yes" : "no");
  RB_LOGI("initial CRC: %08x\n", options.initial_crc);

  // The integrity test opens the path as typed, and its result ends the run.
  if (options.test) return test_block_chain(path, blk_dev, options.initial_crc);

  RB_LOGI("initializing block chain (i=%08x)\n", options.initial_crc);
  // A read-out fills no header: the lines below then show zeros.
  initial_block_header ibh = {};
  int rc = options.read_out_path != nullptr
               ? raw_read_blocks(typed_path(absolute), blk_dev, typed_path(options.read_out_path))
               : raw_write_blocks(typed_path(absolute), blk_dev, &ibh, options.initial_crc,
                                  options.progress);
  if (rc != 0) return rc;
  RB_LOGI("Success\n");
  printf("%s\n", blk_dev);
  // Block size before first block: the order platform scripts parse.
  printf("0x%08x\n", ibh.magic);
  printf("0x%x\n", ibh.block_size);
  printf("0x%x\n", ibh.first_block);
  printf("0x%x\n", ibh.block_count);
  printf("0x%08x\n", ibh.initial_crc);
  printf("0x%08x\n", ibh.state);
  return 0;
}
