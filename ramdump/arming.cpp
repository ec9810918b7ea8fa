#include "ramdump/arming.h"

#include <android-base/unique_fd.h>
#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/types.h>
#include <unistd.h>

#include "platform/log.h"
#include "ramdump/block_device.h"
#include "ramdump/block_map.h"
#include "ramdump/retry_io.h"

namespace {

constexpr size_t kCreateChunk = 65536;

}  // namespace

int create_file(const file_ref& file, int64_t size, int progress) {
  // The buffer is kept, also on success: the process ends soon after.
  android::base::unique_fd fd(open_file(file, O_WRONLY | O_CREAT | O_TRUNC, 0660));
  if (fd < 0) {
    RB_LOGE("failed to open file:%s for writing: %s\n", file.path != nullptr ? file.path : "(null)",
            strerror(errno));
    return -1;
  }
  uint8_t* buf = static_cast<uint8_t*>(malloc(kCreateChunk));
  if (buf == nullptr) {
    RB_LOGE("failed to allocate block buffer\n");
    return -1;
  }
  RB_LOGI("Creating reserved area %zd bytes\n", static_cast<ssize_t>(size));
  // 0xFF is what a read of the reserved file shows before it is armed.
  memset(buf, 0xFF, kCreateChunk);
  const int32_t chunks = static_cast<int32_t>(size >> 16);
  for (int32_t i = 0; i < chunks; ++i) {
    if (progress && (i & 0xFF) == 0) fprintf(stderr, "%d/%d\n", i, chunks);
    if (write_retry(fd, buf, kCreateChunk) < 0) return -1;
  }
  if ((size & 0xFFFF) != 0 && write_retry(fd, buf, static_cast<size_t>(size & 0xFFFF)) < 0) {
    return -1;
  }
  if (progress) fprintf(stderr, "%d/%d\n", chunks, chunks);
  fsync(fd);
  return 0;
}

int write_contiguous_headers(int dev_fd, const int64_t* first, uint32_t n, uint32_t next_block,
                             uint8_t* buffer, int64_t block_size, uint32_t* running_crc) {
  off64_t offset = static_cast<off64_t>(static_cast<uint32_t>(first[0])) * block_size;
  if (seek_retry(dev_fd, offset) < 0) {
    RB_LOGE("error seeking to block %08lx: %s\n", static_cast<unsigned long>(first[0]),
            strerror(errno));
    return -1;
  }
  // Headers are built in chain order, run after run, because each CRC continues the last.
  for (uint32_t k = 0; k < n; ++k) {
    uint32_t next = k + 1 < n ? static_cast<uint32_t>(first[k + 1]) : next_block;
    chain_block_header h =
        make_chain_block_header(static_cast<uint32_t>(first[k]), next, n, k, running_crc);
    encode_chain_block_header(h, buffer + static_cast<int64_t>(k) * block_size);
  }
  int rc = write_retry(dev_fd, buffer, static_cast<size_t>(n * block_size));
  start_writeback(dev_fd, offset, n * block_size);
  return rc;
}

void write_chain(int dev_fd, const int64_t* list, uint32_t count, uint8_t* buffer,
                 int64_t block_size, uint32_t initial_crc, int progress) {
  uint32_t running_crc = initial_crc;
  uint32_t start = 0;
  uint32_t n = 0;
  for (uint32_t i = 0; i < count; ++i) {
    if (progress && (i & 0x1FFF) == 0) {
      fprintf(stderr, "%d/%d\n", static_cast<int>(i), static_cast<int>(count));
    }
    if (extends_run(list, i, n)) {
      ++n;
      continue;
    }
    if (n > 0) {
      write_contiguous_headers(dev_fd, list + start, n, static_cast<uint32_t>(list[i]), buffer,
                               block_size, &running_crc);
    }
    start = i;
    n = 1;
  }
  write_contiguous_headers(dev_fd, list + start, n, 0, buffer, block_size, &running_crc);
  if (progress) fprintf(stderr, "%d/%d\n", static_cast<int>(count), static_cast<int>(count));
}

int raw_write_blocks(const file_ref& block_file, const char* blk_dev, initial_block_header* ibh,
                     uint32_t initial_crc, int progress) {
  // The buffers obtained before a failure are not released: the process ends right after a
  // failed arming.
  int64_t block_size;
  uint32_t count;
  int64_t size;
  if (stat_block_file(block_file, &block_size, &count, &size) != 0) return -1;
  RB_LOGI(" block size: %ld bytes\n", static_cast<long>(block_size));
  RB_LOGI(" file size: %lld bytes, %d full blocks available\n", static_cast<long long>(size),
          static_cast<int>(count));
  if (count == 0) {
    RB_LOGE("0 full blocks available in file\n");
    return -1;
  }
  android::base::unique_fd fd(open_file(block_file, O_RDONLY));
  if (fd < 0) {
    RB_LOGE("failed to open fd for reading: %s\n", strerror(errno));
    return -1;
  }
  // Delayed allocation must have placed every block before the blocks are mapped.
  fsync(fd);
  android::base::unique_fd dev_fd(open_file(typed_path(blk_dev), O_WRONLY));
  if (dev_fd < 0) {
    RB_LOGE("failed to open blk_dev for writing: %s\n", strerror(errno));
    return -1;
  }
  RB_LOGI("Opened %s for writing\n", blk_dev);
  if (check_device_holds_file(dev_fd, blk_dev, fd, block_file.path) != 0) return -1;
  int64_t* list = static_cast<int64_t*>(malloc(static_cast<size_t>(count) * sizeof(int64_t)));
  if (list == nullptr) {
    RB_LOGE("failed to allocate block list\n");
    return -1;
  }
  prefetch_block_map(fd);
  // The whole file is mapped before anything is written, so a file that cannot be mapped
  // leaves the device untouched.
  for (uint32_t i = 0; i < count; ++i) {
    int block = static_cast<int>(i);
    int rc = fibmap(fd, &block);
    // Tested before the ioctl's result: block 0 of the device is never part of a chain,
    // and a failed mapping of logical block 0 leaves 0 behind.
    if (block == 0) {
      RB_LOGE("refusing to write to block 0\n");
      return -1;
    }
    if (rc != 0) {
      RB_LOGE("failed to find block %d\n", static_cast<int>(i));
      return -1;
    }
    list[i] = block;
  }

  initial_block_header header;
  header.magic = INITIAL_BLOCK_HEADER_MAGIC;
  header.first_block = static_cast<uint32_t>(list[0]);
  header.block_size = static_cast<uint32_t>(block_size);
  header.block_count = count;
  header.initial_crc = initial_crc;
  header.state = STATE_ARMED;

  uint8_t* buffer = static_cast<uint8_t*>(calloc(MAX_RUN_BLOCKS, static_cast<size_t>(block_size)));
  if (buffer == nullptr) {
    RB_LOGE("Failed to allocate contiguous block buffer\n");
    return -1;
  }
  write_chain(dev_fd, list, count, buffer, block_size, initial_crc, progress);

  fd.reset();
  fsync(dev_fd);
  dev_fd.reset();
  free(list);
  free(buffer);
  *ibh = header;
  return 0;
}
