#include "platform/log.h"

#include <android-base/logging.h>

#ifndef __BIONIC__
#include <android-base/file.h>
#include <errno.h>
#include <fcntl.h>
#include <unistd.h>

#include <string>

namespace {

char priority_letter(int priority) {
  static const char kLetters[] = "??VDIWEF";
  return priority >= 0 && priority < 8 ? kLetters[priority] : '?';
}

// The log file only where it exists: creating it would leave a world-writable file in a build
// host's real /dev. It stays open for the process's lifetime.
int host_log_fd() {
  static const int fd = TEMP_FAILURE_RETRY(open(RB_HOST_LOG_PATH, O_WRONLY | O_APPEND | O_CLOEXEC));
  return fd >= 0 ? fd : STDERR_FILENO;
}

// Not liblog's own stderr logger: it puts the source file and line in front of libbase's
// records and leaves an empty line after every message that ends in a line feed.
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
  // A record is one write with O_APPEND, so records of concurrent writers stay whole.
  android::base::WriteFully(host_log_fd(), line.data(), line.size());
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
