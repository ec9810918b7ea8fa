// Writes all of a buffer, continuing after partial writes and interruptions, for the host
// substitutes of the system log and the property service.
#pragma once

#include <errno.h>
#include <unistd.h>

inline bool write_all(int fd, const char* data, size_t length) {
  while (length > 0) {
    ssize_t n = write(fd, data, length);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    data += n;
    length -= static_cast<size_t>(n);
  }
  return true;
}
