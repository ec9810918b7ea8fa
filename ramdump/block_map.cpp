#include "ramdump/block_map.h"

#include <errno.h>
#include <linux/fiemap.h>
#include <linux/fs.h>
#include <string.h>
#include <sys/ioctl.h>
#include <sys/stat.h>

#include "platform/log.h"

static_assert(FIBMAP == 1, "the block-mapping ioctl is request 1");

int stat_block_file(const file_ref& file, int64_t* block_size, uint32_t* count, int64_t* size) {
  struct stat st;
  if (stat_file(file, &st) != 0) {
    RB_LOGE("failed to stat %s: %s\n", file.path, strerror(errno));
    return -1;
  }
  *block_size = static_cast<int32_t>(st.st_blksize);
  *size = st.st_size;
  // No Linux file system reports a block size of 0; if one did, the file holds no blocks.
  *count = *block_size > 0 ? static_cast<uint32_t>(*size / *block_size) : 0;
  return 0;
}

void prefetch_block_map(int fd) {
  // Counting the extents walks all of them; no extent records are copied out.
  struct fiemap request;
  memset(&request, 0, sizeof(request));
  request.fm_length = FIEMAP_MAX_OFFSET;
  ioctl(fd, FS_IOC_FIEMAP, &request);
}

int fibmap(int fd, int* block) { return ioctl(fd, FIBMAP, block); }
