#include "ramdump/chain_check.h"

#include <android-base/unique_fd.h>
#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <unistd.h>

#include "platform/log.h"
#include "ramdump/block_device.h"
#include "ramdump/block_map.h"
#include "ramdump/chain_format.h"
#include "ramdump/retry_io.h"

int test_block_chain(const char* block_file, const char* blk_dev, uint32_t initial_crc) {
  // Kept open until the device is known to hold it; nothing depends on when it is closed.
  android::base::unique_fd fd(open_file(typed_path(block_file), O_RDONLY | O_SYNC));
  if (fd < 0) {
    RB_LOGE("failed to open %s for reading: %s\n", block_file, strerror(errno));
    return -1;
  }
  int first = 0;
  if (fibmap(fd, &first) != 0) {
    RB_LOGE("Failed to get block 0 for file %s: %s\n", block_file, strerror(errno));
    first = 0;
  }
  int64_t block_size;
  uint32_t file_blocks;  // not used: the walk follows the links, not the file
  int64_t size;
  if (stat_block_file(typed_path(block_file), &block_size, &file_blocks, &size) != 0) return -1;
  RB_LOGI(" block size: %ld bytes\n", static_cast<long>(block_size));
  android::base::unique_fd dev_fd(open_file(typed_path(blk_dev), O_RDONLY | O_SYNC));
  if (dev_fd < 0) {
    RB_LOGE("failed to open blk_dev:%s for reading: %s\n", blk_dev, strerror(errno));
    return -1;
  }
  RB_LOGI("Opened %s for reading\n", blk_dev);
  if (first == 0) {
    RB_LOGI("Read %d blocks successfully\n", 0);
    return 0;
  }
  // Checked only now: without a first block nothing is read from the device.
  if (check_device_holds_file(dev_fd, blk_dev, fd, block_file) != 0) return -1;
  fd.reset();

  uint32_t block = static_cast<uint32_t>(first);
  uint32_t running_crc = initial_crc;
  uint32_t count = 0;  // a looping chain is walked for ever; the count just wraps
  bool mismatch = false;
  for (;;) {
    off64_t offset = static_cast<off64_t>(block) * block_size;
    if (seek_retry(dev_fd, offset) < 0) {
      RB_LOGE("error seeking to block %08lx: %s\n", static_cast<unsigned long>(block),
              strerror(errno));
      return -1;
    }
    // Cleared first, so that a read that ends early never shows the previous header again.
    uint8_t raw[CHAIN_BLOCK_HEADER_SIZE] = {};
    if (read_retry(dev_fd, raw, sizeof(raw)) < 0) return -1;
    chain_block_header h = decode_chain_block_header(raw);
    if (h.magic != CHAIN_BLOCK_MAGIC) {
      RB_LOGE("Bad magic at block %lx, got %08x\n", static_cast<unsigned long>(block), h.magic);
      return -2;
    }
    running_crc = chain_crc(running_crc, block, h.next_block);
    // Only the first mismatch is reported; the walk goes on to count the chain.
    if (!mismatch && h.crc != running_crc) {
      RB_LOGE("CRC32 mismatch at block %lx, got %08x, expecting %08x\n",
              static_cast<unsigned long>(block), h.crc, running_crc);
      mismatch = true;
    }
    ++count;
    if (h.next_block == 0) {
      RB_LOGI("Read %d blocks successfully\n", static_cast<int>(count));
      if (mismatch) RB_LOGW("Integrity of chain not verified due to CRC mismatch\n");
      return 0;
    }
    block = h.next_block;
  }
}
