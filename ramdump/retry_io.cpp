#include "ramdump/retry_io.h"

#include <android-base/file.h>
#include <android-base/macros.h>
#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <unistd.h>

#include "platform/log.h"

// Not ReadFully: an early end of the file is no error here.
int read_retry(int fd, void* buf, size_t length) {
  char* p = static_cast<char*>(buf);
  while (length > 0) {
    ssize_t n = read(fd, p, length);
    if (n < 0) {
      if (errno == EINTR) continue;
      RB_LOGE("error reading: %s\n", strerror(errno));
      return -1;
    }
    if (n == 0) break;
    p += n;
    length -= static_cast<size_t>(n);
  }
  return 0;
}

int write_retry(int fd, const void* buf, size_t length) {
  if (!android::base::WriteFully(fd, buf, length)) {
    RB_LOGE("error writing: %s\n", strerror(errno));
    return -1;
  }
  return 0;
}

off64_t seek_retry(int fd, off64_t offset) {
  return TEMP_FAILURE_RETRY(lseek64(fd, offset, SEEK_SET));
}

void start_writeback(int fd, off64_t offset, off64_t length) {
  sync_file_range(fd, offset, length, SYNC_FILE_RANGE_WRITE);
}
