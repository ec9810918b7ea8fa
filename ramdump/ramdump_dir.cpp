#include "ramdump/ramdump_dir.h"

#include <android-base/unique_fd.h>
#include <errno.h>
#include <string.h>
#include <sys/file.h>
#include <unistd.h>

#include <chrono>
#include <string>

#include "platform/log.h"
#include "ramdump/ramdump_names.h"

namespace {

constexpr std::chrono::seconds kLockWait(120);
constexpr useconds_t kLockPollMicroseconds = 50000;

bool same_file(const struct stat& a, const struct stat& b) {
  return a.st_dev == b.st_dev && a.st_ino == b.st_ino;
}

}  // namespace

int ramdump_dir() {
  static int fd = -2;
  static int error = 0;
  if (fd == -2) {
    fd = open(RAMDUMP_DIR, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    error = errno;
  }
  if (fd < 0) errno = error;
  return fd;
}

file_ref in_ramdump_dir(const char* name, const char* path) {
  const int dir = ramdump_dir();
  return {path, name, dir, dir < 0 ? errno : 0};
}

int lock_ramdump_dir() {
  const int dir = ramdump_dir();
  if (dir < 0 || flock(dir, LOCK_EX | LOCK_NB) == 0) return 0;
  if (errno != EWOULDBLOCK) {
    RB_LOGE("Could not lock %s: %s\n", RAMDUMP_DIR, strerror(errno));
    return -1;
  }
  RB_LOGI("Waiting for another run on %s\n", RAMDUMP_DIR);
  // Anyone who can open the directory can hold a shared lock on it: the wait is bounded so
  // that such a process cannot stall the boot-time run for ever.
  const auto deadline = std::chrono::steady_clock::now() + kLockWait;
  while (std::chrono::steady_clock::now() < deadline) {
    usleep(kLockPollMicroseconds);
    if (flock(dir, LOCK_EX | LOCK_NB) == 0) return 0;
    if (errno != EWOULDBLOCK && errno != EINTR) {
      RB_LOGE("Could not lock %s: %s\n", RAMDUMP_DIR, strerror(errno));
      return -1;
    }
  }
  RB_LOGE("Gave up waiting for another run on %s after %lld seconds\n", RAMDUMP_DIR,
          static_cast<long long>(kLockWait.count()));
  return -1;
}

bool is_reserved_file(const char* path) {
  const int dir = ramdump_dir();
  struct stat file, reserved, parent, here;
  if (path == nullptr || dir < 0) return false;
  if (stat(path, &file) == 0) {
    return fstatat(dir, RAMDUMP_RESERVED_NAME, &reserved, AT_SYMLINK_NOFOLLOW) == 0 &&
           same_file(file, reserved);
  }
  const char* slash = strrchr(path, '/');
  const std::string parent_path = slash == nullptr ? "."
                                  : slash == path  ? "/"
                                                   : std::string(path, slash);
  return strcmp(slash == nullptr ? path : slash + 1, RAMDUMP_RESERVED_NAME) == 0 &&
         stat(parent_path.c_str(), &parent) == 0 && fstat(dir, &here) == 0 &&
         same_file(parent, here);
}

void remove_collected_dump() {
  const int dir = ramdump_dir();
  android::base::unique_fd parent(dir < 0 ? -1 : open_dir_at(dir, RAMDUMP_OUTPUT_PARENT_NAME));
  if (parent < 0) return;
  android::base::unique_fd out(open_dir_at(parent, RAMDUMP_OUTPUT_DIR_NAME));
  if (out >= 0) {
    unlinkat(out, RAMDUMP_OUTPUT_NAME, 0);
    unlinkat(out, RAMDUMP_MSG_NAME, 0);
  }
  unlinkat(parent, RAMDUMP_OUTPUT_DIR_NAME, AT_REMOVEDIR);
}

int recreate_output_dir() {
  const int dir = ramdump_dir();
  if (dir < 0) return -1;
  remove_collected_dump();
  mkdirat(dir, RAMDUMP_OUTPUT_PARENT_NAME, 0777);
  android::base::unique_fd parent(open_dir_at(dir, RAMDUMP_OUTPUT_PARENT_NAME));
  if (parent < 0) return -1;
  mkdirat(parent, RAMDUMP_OUTPUT_DIR_NAME, 0777);
  return open_dir_at(parent, RAMDUMP_OUTPUT_DIR_NAME);
}
