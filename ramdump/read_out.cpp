#include "ramdump/read_out.h"

#include <android-base/file.h>
#include <android-base/unique_fd.h>
#include <errno.h>
#include <fcntl.h>
#include <stdint.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include "platform/log.h"
#include "ramdump/block_device.h"
#include "ramdump/block_map.h"
#include "ramdump/retry_io.h"

namespace {

// Physically consecutive blocks are copied with one read and one write of up to this many
// bytes, as fast as the device streams.
constexpr int64_t kRunBytes = 4 << 20;

// One block: seek, read it into the one-block buffer (a device that ends early leaves the
// rest of the buffer as it was) and write the buffer whole.
int copy_block(int dev_fd, int out_fd, uint32_t block, int64_t block_size, uint8_t* buf) {
  if (seek_retry(dev_fd, static_cast<off64_t>(block) * block_size) < 0) {
    RB_LOGE("error seeking to block %08x: %s\n", block, strerror(errno));
    return -1;
  }
  if (read_retry(dev_fd, buf, static_cast<size_t>(block_size)) < 0 ||
      write_retry(out_fd, buf, static_cast<size_t>(block_size)) < 0) {
    return -1;
  }
  return 0;
}

// n physically consecutive blocks from first. When the device delivers them all (an error or
// an early end makes ReadFully fail) they are copied in one piece; otherwise block by block, so
// that a read error or an early end of the device leaves the same output and the same messages as a
// copy one block at a time.
int copy_run(int dev_fd, int out_fd, uint32_t first, uint32_t n, int64_t block_size, uint8_t* buf,
             uint8_t* run_buf) {
  const size_t bytes = static_cast<size_t>(n * block_size);
  if (n > 1 && seek_retry(dev_fd, static_cast<off64_t>(first) * block_size) >= 0 &&
      android::base::ReadFully(dev_fd, run_buf, bytes)) {
    if (write_retry(out_fd, run_buf, bytes) < 0) return -1;
    // As after a copy block by block, the one-block buffer holds the last block.
    memcpy(buf, run_buf + bytes - block_size, static_cast<size_t>(block_size));
    return 0;
  }
  for (uint32_t k = 0; k < n; ++k) {
    if (copy_block(dev_fd, out_fd, first + k, block_size, buf) != 0) return -1;
  }
  return 0;
}

}  // namespace

int raw_read_blocks(const file_ref& block_file, const char* blk_dev, const file_ref& out_file,
                    int* kept_out) {
  if (kept_out != nullptr) *kept_out = -1;
  int64_t block_size;
  uint32_t count;
  int64_t size;
  if (stat_block_file(block_file, &block_size, &count, &size) != 0) return -1;

  // The buffer is not released after an early failure: the process ends right after a failed
  // read-out.
  uint8_t* buf = static_cast<uint8_t*>(malloc(static_cast<size_t>(block_size)));
  if (buf == nullptr) {
    RB_LOGE("failed to allocate block buffer\n");
    return -1;
  }
  android::base::unique_fd in_fd(open_file(block_file, O_RDONLY));
  if (in_fd < 0) {
    RB_LOGE("failed to open infile:%s for reading: %s\n", block_file.path, strerror(errno));
    return -1;
  }
  // Delayed allocation must have placed every block before the blocks are mapped.
  fsync(in_fd);
  android::base::unique_fd dev_fd(open_file(typed_path(blk_dev), O_RDONLY | O_SYNC));
  if (dev_fd < 0) {
    RB_LOGE("failed to open blk_dev:%s for reading: %s\n", blk_dev, strerror(errno));
    return -1;
  }
  RB_LOGI("Opened %s for reading\n", blk_dev);
  // A file without a full block reads nothing from the device: its empty read-out is no risk.
  if (count > 0 && check_device_holds_file(dev_fd, blk_dev, in_fd, block_file.path) != 0) {
    return -1;
  }
  android::base::unique_fd out_fd(open_file(out_file, O_WRONLY | O_CREAT | O_TRUNC, 0666));
  if (out_fd < 0) {
    RB_LOGE("failed to open outfile:%s for writing: %s\n", out_file.path, strerror(errno));
    return -1;
  }
  RB_LOGI("Opened %s for writing\n", out_file.path);
  if (kept_out != nullptr) *kept_out = fcntl(out_fd, F_DUPFD_CLOEXEC, 0);

  // Without room for a whole run the copy simply goes one block at a time.
  uint32_t run_blocks = block_size < kRunBytes ? static_cast<uint32_t>(kRunBytes / block_size) : 1;
  uint8_t* run_buf = nullptr;
  if (run_blocks > 1) run_buf = static_cast<uint8_t*>(malloc(static_cast<size_t>(kRunBytes)));
  if (run_buf == nullptr) run_blocks = 1;

  // Blocks are mapped ahead up to the end of their run; a block that cannot be mapped is
  // reported only after every block before it has been copied.
  prefetch_block_map(in_fd);
  int result = 0;
  off64_t out_offset = 0;
  int next_mapped = 0;
  bool next_known = false;
  for (uint32_t i = 0; i < count;) {
    // A hole maps to 0 and is not refused here: block 0 of the device is read instead.
    int first = static_cast<int>(i);
    if (next_known) {
      first = next_mapped;
    } else if (fibmap(in_fd, &first) != 0) {
      RB_LOGE("failed to find block %d\n", static_cast<int>(i));
      result = -1;
      break;
    }
    next_known = false;
    uint32_t n = 1;
    bool unmappable = false;
    while (n < run_blocks && i + n < count) {
      int block = static_cast<int>(i + n);
      if (fibmap(in_fd, &block) != 0) {
        unmappable = true;
        break;
      }
      if (static_cast<int64_t>(block) != static_cast<int64_t>(first) + n) {
        next_mapped = block;
        next_known = true;
        break;
      }
      ++n;
    }
    if (copy_run(dev_fd, out_fd, static_cast<uint32_t>(first), n, block_size, buf, run_buf) != 0) {
      result = -1;
      break;
    }
    start_writeback(out_fd, out_offset, n * block_size);
    out_offset += n * block_size;
    i += n;
    if (unmappable) {
      RB_LOGE("failed to find block %d\n", static_cast<int>(i));
      result = -1;
      break;
    }
  }
  in_fd.reset();
  dev_fd.reset();
  fsync(out_fd);
  out_fd.reset();
  free(run_buf);
  free(buf);
  return result;
}
