#include "ramdump/read_out.h"

#include <errno.h>
#include <fcntl.h>
#include <stdint.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include "platform/log.h"
#include "ramdump/block_map.h"
#include "ramdump/retry_io.h"

int raw_read_blocks(const char* block_file, const char* blk_dev, const char* out_file) {
  int64_t block_size;
  uint32_t count;
  int64_t size;
  if (stat_block_file(block_file, &block_size, &count, &size) != 0) return -1;

  // The early failures below return without releasing what is already open: the process
  // ends right after a failed read-out.
  uint8_t* buf = static_cast<uint8_t*>(malloc(static_cast<size_t>(block_size)));
  if (buf == nullptr) {
    RB_LOGE("failed to allocate block buffer\n");
    return -1;
  }
  int in_fd = open(block_file, O_RDONLY | O_CLOEXEC);
  if (in_fd < 0) {
    RB_LOGE("failed to open infile:%s for reading: %s\n", block_file, strerror(errno));
    return -1;
  }
  // Delayed allocation must have placed every block before the blocks are mapped.
  fsync(in_fd);
  int dev_fd = open(blk_dev, O_RDONLY | O_SYNC | O_CLOEXEC);
  if (dev_fd < 0) {
    RB_LOGE("failed to open blk_dev:%s for reading: %s\n", blk_dev, strerror(errno));
    return -1;
  }
  RB_LOGI("Opened %s for reading\n", blk_dev);
  int out_fd = open(out_file, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0666);
  if (out_fd < 0) {
    RB_LOGE("failed to open outfile:%s for writing: %s\n", out_file, strerror(errno));
    return -1;
  }
  RB_LOGI("Opened %s for writing\n", out_file);

  int result = 0;
  for (uint32_t i = 0; i < count; ++i) {
    // A hole maps to 0 and is not refused here: block 0 of the device is read instead.
    int block = static_cast<int>(i);
    if (fibmap(in_fd, &block) != 0) {
      RB_LOGE("failed to find block %d\n", static_cast<int>(i));
      result = -1;
      break;
    }
    off64_t offset = static_cast<off64_t>(static_cast<uint32_t>(block)) * block_size;
    if (seek_retry(dev_fd, offset) < 0) {
      RB_LOGE("error seeking to block %08x: %s\n", static_cast<unsigned>(block), strerror(errno));
      result = -1;
      break;
    }
    if (read_retry(dev_fd, buf, static_cast<size_t>(block_size)) < 0 ||
        write_retry(out_fd, buf, static_cast<size_t>(block_size)) < 0) {
      result = -1;
      break;
    }
  }
  close(in_fd);
  close(dev_fd);
  fsync(out_fd);
  close(out_fd);
  free(buf);
  return result;
}
