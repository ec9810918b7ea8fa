#include "platform/log.h"

#include <android-base/logging.h>
#include <errno.h>
#include <fcntl.h>
#include <unistd.h>

#include <string>

#include "platform/write_all.h"

#ifndef __BIONIC__
namespace {

int host_log_fd = -2;  // -2: not opened yet, -1: unavailable, use standard error

char priority_letter(int priority) {
  static const char kLetters[] = "??VDIWEF";
  return priority >= 0 && priority < 8 ? kLetters[priority] : '?';
}

void host_log_writer(const struct __android_logger_data* data, const char* message) {
  int saved_errno = errno;
  std::string line;
  line += priority_letter(data->priority);
  line += ' ';
  line += data->tag != nullptr ? data->tag : "";
  line += ": ";
  for (const char* p = message; *p != '\0'; ++p) {
    if (*p == '\n') {
      line += "\\n";
    } else if (*p == '\\') {
      line += "\\\\";
    } else {
      line += *p;
    }
  }
  line += '\n';
  if (host_log_fd == -2) {
    host_log_fd = open(RB_HOST_LOG_PATH, O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0666);
  }
  int fd = host_log_fd >= 0 ? host_log_fd : STDERR_FILENO;
  // A record is one write with O_APPEND, so records of concurrent writers stay whole.
  write_all(fd, line.data(), line.size());
  errno = saved_errno;
}

}  // namespace
#endif

void platform_init_logging() {
#ifndef __BIONIC__
  // libbase hands its records to liblog's logger, so this one sink takes both kinds.
  __android_log_set_logger(host_log_writer);
#endif
  android::base::SetMinimumLogSeverity(android::base::INFO);
}
