#include "tools/dump_reader/cli.h"

#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

bool wants_help(int argc, char** argv) {
  for (int i = 1; i < argc; ++i) {
    if (strcmp(argv[i], "--help") == 0 || strcmp(argv[i], "-h") == 0) return true;
  }
  return false;
}

bool split_args(int argc, char** argv, const char* const* flags, const char* usage, unsigned* seen,
                std::vector<const char*>* operands) {
  *seen = 0;
  bool options = true;
  for (int i = 1; i < argc; ++i) {
    const char* arg = argv[i];
    if (!options || arg[0] != '-' || arg[1] == '\0') {
      operands->push_back(arg);
      continue;
    }
    if (strcmp(arg, "--") == 0) {
      options = false;
      continue;
    }
    unsigned f = 0;
    while (flags[f] != nullptr && strcmp(flags[f], arg) != 0) ++f;
    if (flags[f] == nullptr) {
      usage_error(usage, std::string("unknown option '") + arg + "'");
      return false;
    }
    *seen |= 1u << f;
  }
  return true;
}

int usage_error(const char* usage, const std::string& message) {
  fprintf(stderr, "ramdump_inspect: %s\n%s", message.c_str(), usage);
  return kExitUsage;
}

int fail(const std::string& file, const std::string& problem) {
  fprintf(stderr, "ramdump_inspect: %s: %s\n", file.c_str(), problem.c_str());
  return kExitBad;
}

int open_input(const char* path, struct stat* st) {
  int fd = open(path, O_RDONLY | O_NONBLOCK | O_CLOEXEC | O_NOCTTY);
  if (fd < 0) return -1;
  const int flags = fcntl(fd, F_GETFL);
  if (fstat(fd, st) != 0 || flags < 0 || fcntl(fd, F_SETFL, flags & ~O_NONBLOCK) != 0) {
    const int error = errno;
    close(fd);
    errno = error;
    return -1;
  }
  return fd;
}

bool parse_u32(const char* text, bool hex, uint32_t* out) {
  if (text == nullptr || *text == '\0' || *text == '-' || *text == '+' || *text == ' ')
    return false;
  char* end = nullptr;
  errno = 0;
  // Base 0 would read a leading 0 as octal: "010" is ten here.
  const bool prefixed = text[0] == '0' && (text[1] == 'x' || text[1] == 'X');
  unsigned long long v = strtoull(text, &end, hex || prefixed ? 16 : 10);
  if (errno != 0 || *end != '\0' || v > 0xFFFFFFFFull) return false;
  *out = static_cast<uint32_t>(v);
  return true;
}

std::string json_string(const std::string& text) {
  std::string out = "\"";
  for (unsigned char c : text) {
    if (c == '"' || c == '\\') {
      out += '\\';
      out += static_cast<char>(c);
    } else if (c >= 0x20 && c < 0x7F) {
      out += static_cast<char>(c);
    } else {
      char esc[8];
      snprintf(esc, sizeof(esc), "\\u%04x", c);
      out += esc;
    }
  }
  return out + "\"";
}

std::string printable(const std::string& bytes) {
  std::string out;
  for (unsigned char c : bytes) {
    if (c >= 0x20 && c < 0x7F && c != '\\') {
      out += static_cast<char>(c);
    } else {
      char esc[8];
      snprintf(esc, sizeof(esc), "\\x%02x", c);
      out += esc;
    }
  }
  return out;
}

namespace {

double now_seconds() {
  timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return static_cast<double>(ts.tv_sec) + static_cast<double>(ts.tv_nsec) / 1e9;
}

}  // namespace

progress progress_begin(const char* what, uint64_t total) {
  double t = now_seconds();
  return progress{what, total, isatty(STDERR_FILENO) == 1, false, t, t};
}

void progress_update(progress* p, uint64_t done) {
  if (!p->enabled) return;
  double t = now_seconds();
  if (t - p->start < 2.0 || t - p->last < 0.25) return;
  p->last = t;
  p->shown = true;
  if (p->total > 0) {
    fprintf(stderr, "\r%s: %3d%% (%llu of %llu MiB)", p->what,
            static_cast<int>(done * 100 / p->total), static_cast<unsigned long long>(done >> 20),
            static_cast<unsigned long long>(p->total >> 20));
  } else {
    fprintf(stderr, "\r%s: %llu MiB", p->what, static_cast<unsigned long long>(done >> 20));
  }
}

void progress_end(progress* p) {
  if (p->shown) fprintf(stderr, "\r\033[K");
  p->shown = false;
}
