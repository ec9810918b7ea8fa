#include "ramdump/file_ref.h"

#include <errno.h>
#include <unistd.h>

#include "platform/log.h"

namespace {

bool own_regular_file(const struct stat& st) { return S_ISREG(st.st_mode) && st.st_nlink == 1; }

int fail(int fd, int error) {
  if (fd >= 0) close(fd);
  errno = error;
  return -1;
}

}  // namespace

int open_file(const file_ref& file, int flags, mode_t mode) {
  // Without an operand on the command line the open fails as it would on a bad pointer.
  if (file.fd >= 0) return fcntl(file.fd, F_DUPFD_CLOEXEC, 0);
  if (file.name == nullptr) return fail(-1, EFAULT);
  if (file.dir_fd == -1) return fail(-1, file.dir_error);
  const bool fixed = file.dir_fd != AT_FDCWD;
  // The type is known only after the open: a terminal opened here must not become the
  // process's controlling terminal.
  const int open_flags =
      (fixed ? (flags & ~O_TRUNC) | O_NOFOLLOW : flags) | O_NONBLOCK | O_CLOEXEC | O_NOCTTY;
  int fd = openat(file.dir_fd, file.name, open_flags, mode);
  if (fd < 0) return -1;
  if (fixed) {
    struct stat st;
    if (fstat(fd, &st) != 0) return fail(fd, errno);
    if (!own_regular_file(st)) {
      return fail(fd, S_ISDIR(st.st_mode) ? EISDIR : S_ISREG(st.st_mode) ? EMLINK : ENXIO);
    }
    if ((flags & O_TRUNC) != 0 && ftruncate(fd, 0) != 0) return fail(fd, errno);
  }
  // Only the open must not wait; reads and writes block as they always did.
  const int status = fcntl(fd, F_GETFL);
  if (status < 0 || fcntl(fd, F_SETFL, status & ~O_NONBLOCK) != 0) return fail(fd, errno);
  return fd;
}

int stat_file(const file_ref& file, struct stat* st) {
  if (file.fd >= 0) return fstat(file.fd, st);
  if (file.name == nullptr) return fail(-1, EFAULT);
  if (file.dir_fd == -1) return fail(-1, file.dir_error);
  return fstatat(file.dir_fd, file.name, st, file.dir_fd == AT_FDCWD ? 0 : AT_SYMLINK_NOFOLLOW);
}

bool usable_fixed_file(const struct stat& st, const char* path) {
  if (own_regular_file(st)) return true;
  RB_LOGE("%s is not a regular file with a single link, leaving it alone\n", path);
  return false;
}

int open_dir_at(int dir_fd, const char* name) {
  return openat(dir_fd, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
}
