#include "ramdump/auto_cycle.h"

#include <android-base/stringprintf.h>
#include <android-base/unique_fd.h>
#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <string>

#include "fs_mgr/fs_mgr_fstab.h"
#include "misc/misc_store.h"
#include "platform/log.h"
#include "ramdump/arming.h"
#include "ramdump/block_device.h"
#include "ramdump/block_map.h"
#include "ramdump/chain_format.h"
#include "ramdump/dump_extract.h"
#include "ramdump/file_ref.h"
#include "ramdump/misc_flags.h"
#include "ramdump/ramdump_dir.h"
#include "ramdump/ramdump_names.h"
#include "ramdump/read_out.h"

namespace {

constexpr int64_t kReservedFileSize = 4429185024;    // 4224 MiB
constexpr uint64_t kSpaceToCreate = 10737418240ULL;  // 10 GiB: reserved file + one dump
constexpr uint64_t kSpaceToKeep = 6442450944ULL;     // 6 GiB: room for one dump
constexpr int kSpaceUnitShift = 31;                  // space is judged in whole 2 GiB units

uint64_t free_bytes_on_data() {
  struct statvfs vfs;
  const int dir = ramdump_dir();
  if (dir < 0 || fstatvfs(dir, &vfs) != 0) {
    RB_LOGE("Could not statvfs %s: %s\n", RAMDUMP_DIR, strerror(errno));
    return 0;
  }
  return static_cast<uint64_t>(vfs.f_bavail) * static_cast<uint64_t>(vfs.f_bsize);
}

std::string fd_path(int fd) { return android::base::StringPrintf("/proc/self/fd/%d", fd); }

// The read-out is read through the descriptor it was written through, and the message file is
// written in place in apq/00 through its opened directory (the extraction neither follows a
// link there nor waits for a FIFO).
void extract_message(int readout, int out_dir) {
  if (readout < 0) {
    fprintf(stderr, "Unable to open %s for reading\n", RAMDUMP_OUTPUT_PATH);
    return;
  }
  extract_ramdump_msg(fd_path(readout).c_str(), fd_path(out_dir).c_str());
}

// The stored header is marked armed without a dump before anything is read out, so that a
// dump that breaks the read-out is not offered again at the next boot.
int read_out_and_rearm(const file_ref& reserved, const char* blk_dev, initial_block_header* ibh,
                       uint32_t progress) {
  uint8_t raw[INITIAL_BLOCK_HEADER_SIZE];
  const uint32_t old_state = ibh->state;
  ibh->state = (old_state & ~(STATE_ARMED | STATE_DUMP_PRESENT)) | STATE_ARMED;
  encode_initial_block_header(*ibh, raw);
  if (MISC_write_RamdumpIBH(raw) != 0) {
    RB_LOGE("Failed to write new initial block header to MISC partition\n");
    return -1;
  }
  if ((old_state & STATE_DUMP_PRESENT) == 0) {
    RB_LOGE("No ramdump found, exiting\n");
    return -1;
  }
  const int out_dir = recreate_output_dir();
  const file_ref output{RAMDUMP_OUTPUT_PATH, RAMDUMP_OUTPUT_NAME, out_dir, out_dir < 0 ? errno : 0};
  android::base::unique_fd out_dir_holder(out_dir);
  int kept = -1;
  int result = raw_read_blocks(reserved, blk_dev, output, &kept);
  android::base::unique_fd readout(kept);
  if (result != 0) RB_LOGE("Failed to read out ramdump from reserved blocks\n");
  extract_message(readout, out_dir);
  // Re-armed even after a failed read-out: the chain must be ready for the next crash.
  raw_write_blocks(reserved, blk_dev, ibh, ibh->initial_crc, static_cast<int>(progress));
  encode_initial_block_header(*ibh, raw);
  if (MISC_write_RamdumpIBH(raw) != 0) {
    RB_LOGE("Failed to write new initial block header to MISC partition\n");
  }
  return result;
}

}  // namespace

int process_auto_ramdump(uint32_t initial_crc, uint32_t progress) {
  const uint64_t free_bytes = free_bytes_on_data();
  const uint64_t units = free_bytes >> kSpaceUnitShift;
  const file_ref reserved = in_ramdump_dir(RAMDUMP_RESERVED_NAME, RAMDUMP_RESERVED_PATH);
  // Anything else at its name is neither present nor missing: its blocks are not ours.
  struct stat st;
  if (stat_file(reserved, &st) == 0 && !usable_fixed_file(st, RAMDUMP_RESERVED_PATH)) return -1;
  const bool present =
      reserved.dir_fd >= 0 && faccessat(reserved.dir_fd, reserved.name, R_OK | W_OK, 0) == 0;
  bool newly_created = false;
  bool enough_space;
  if (!present) {
    enough_space = units >= (kSpaceToCreate >> kSpaceUnitShift);
    if (enough_space) {
      int rc = create_file(reserved, kReservedFileSize, static_cast<int>(progress));
      if (rc < 0) return rc;
      // chmod, without following a link planted meanwhile; the result is ignored.
      android::base::unique_fd created(open_file(reserved, O_RDONLY));
      if (created >= 0) fchmod(created, 0744);
      newly_created = true;
    } else {
      RB_LOGE(
          "Not enough space available to create ramdump reserved file: have %lu bytes, need %lu "
          "bytes\n",
          static_cast<unsigned long>(free_bytes), static_cast<unsigned long>(kSpaceToCreate));
    }
  } else {
    enough_space = units >= (kSpaceToKeep >> kSpaceUnitShift);
    if (!enough_space) {
      RB_LOGE(
          "Not enough space available to create ramdump output file: have %lu bytes, need %lu "
          "bytes\n",
          static_cast<unsigned long>(free_bytes), static_cast<unsigned long>(kSpaceToKeep));
    }
  }
  if (!enough_space) {
    // The reserved file stays; the next run with the feature disabled deletes it.
    RB_LOGE("Disabling ramdump due to not enough free space\n");
    if (write_disabled_ibh() == 0) write_enable_flag(RAMDUMP_DISABLED);
    return -1;
  }

  fstab* table = nullptr;
  const char* blk_dev = nullptr;
  int encryptable = 0;
  int encrypted = 0;
  if (resolve_block_device(RAMDUMP_RESERVED_PATH, &table, &blk_dev, &encryptable, &encrypted) !=
      0) {
    return 1;
  }

  int result = -1;
  android::base::unique_fd fd(open_file(reserved, O_RDONLY | O_SYNC));
  if (fd < 0) {
    RB_LOGE("Failed to open %s for reading; %s\n", RAMDUMP_RESERVED_PATH, strerror(errno));
  } else {
    // Only proves that the file can be mapped; the block found is not used.
    int block = 0;
    // Zeroed first: a misc partition too short for the item leaves part of it unread.
    uint8_t raw[INITIAL_BLOCK_HEADER_SIZE] = {};
    if (fibmap(fd, &block) != 0) {
      RB_LOGE("Failed to get block 0 for file %s; %s\n", RAMDUMP_RESERVED_PATH, strerror(errno));
    } else if (MISC_read_RamdumpIBH(raw) != 0) {
      RB_LOGE("Failed to read initial block header from MISC partition\n");
    } else {
      // From here on the file is the one just opened and checked, whatever its name comes to
      // name: its size, blocks and chain all belong to one inode.
      file_ref held = reserved;
      held.fd = fd;
      initial_block_header ibh = decode_initial_block_header(raw);
      if (newly_created) {
        // A first arming reports failure on purpose: there was no dump to collect.
        if (raw_write_blocks(held, blk_dev, &ibh, initial_crc, static_cast<int>(progress)) == 0) {
          encode_initial_block_header(ibh, raw);
          if (MISC_write_RamdumpIBH(raw) != 0) {
            RB_LOGE("Failed to write initial block header to MISC partition\n");
          }
        }
      } else {
        result = read_out_and_rearm(held, blk_dev, &ibh, progress);
      }
    }
    fd.reset();
  }
  fs_mgr_free_fstab(table);
  return result;
}
