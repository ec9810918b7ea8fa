// Fault injection for the device tests: preloaded (LD_PRELOAD) into the tool, it makes chosen
// system calls fail or come up short, as the environment variable RB_FAULT says:
//
//   RB_FAULT=RULE[,RULE...]   RULE = CALL.TARGET=ACTION | fibmap=ACTION
//
//   CALL    read (read, pread), write (write, pwrite), lseek, fopen
//   TARGET  dev   an open block device (the raw device; the misc images are plain files)
//           data  a regular file under /data
//           misc  a path ending in "/misc" (fopen only)
//   ACTION  ERR%2  every other matching call fails with ERR, starting with the first
//           ERR#k  only the k-th matching call fails
//           ERR+k  the k-th matching call and every later one fail
//           ERR@b  (fibmap) the mapping of logical block b fails, leaving b in place
//           short  a write transfers half of what it was asked (at least one byte)
//   ERR     EINTR, EIO, ENOSPC, EINVAL or ENOENT
//
// With RB_FAULT_TRACE set to a file, every successful write to a block device is appended to
// it as "offset length", so that a test knows exactly what reached the raw device.
#define _GNU_SOURCE
#include <dlfcn.h>
#include <errno.h>
#include <fcntl.h>
#include <stdarg.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <unistd.h>

enum call { C_READ, C_WRITE, C_LSEEK, C_FOPEN, C_FIBMAP };
enum target { T_ANY, T_DEV, T_DATA, T_MISC };
enum when { W_ALTERNATE, W_NTH, W_FROM, W_BLOCK, W_SHORT };

struct rule {
  enum call call;
  enum target target;
  enum when when;
  int error;
  long n;
  long seen;  // matching calls so far
};

static struct rule rules[8];
static int rule_count;

static int error_number(const char* name, size_t len) {
  static const struct {
    const char* name;
    int value;
  } names[] = {
      {"EINTR", EINTR}, {"EIO", EIO}, {"ENOSPC", ENOSPC}, {"EINVAL", EINVAL}, {"ENOENT", ENOENT}};
  for (size_t i = 0; i < sizeof(names) / sizeof(names[0]); ++i) {
    if (strlen(names[i].name) == len && strncmp(names[i].name, name, len) == 0) {
      return names[i].value;
    }
  }
  return -1;
}

// A rule that cannot be read stops the program at once: a test must never pass because its
// fault silently did not apply.
static void bad_rule(const char* text) {
  fprintf(stderr, "fault_inject: cannot read rule '%s'\n", text);
  _exit(120);
}

static void parse_rule(char* text) {
  struct rule r = {0};
  char* eq = strchr(text, '=');
  if (eq == NULL || rule_count == (int)(sizeof(rules) / sizeof(rules[0]))) bad_rule(text);
  *eq = '\0';
  char* dot = strchr(text, '.');
  if (dot != NULL) *dot++ = '\0';
  static const char* const calls[] = {"read", "write", "lseek", "fopen", "fibmap"};
  static const char* const targets[] = {"", "dev", "data", "misc"};
  int c = -1;
  int t = dot == NULL ? T_ANY : -1;
  for (int i = 0; i < 5; ++i) c = strcmp(text, calls[i]) == 0 ? i : c;
  for (int i = 1; dot != NULL && i < 4; ++i) t = strcmp(dot, targets[i]) == 0 ? i : t;
  if (c < 0 || t < 0) bad_rule(text);
  r.call = (enum call)c;
  r.target = (enum target)t;
  const char* action = eq + 1;
  if (strcmp(action, "short") == 0) {
    r.when = W_SHORT;
  } else {
    size_t len = strcspn(action, "%#+@");
    static const char kinds[] = "%#+@";
    if (action[len] == '\0') bad_rule(action);
    r.error = error_number(action, len);
    r.when = (enum when)(strchr(kinds, action[len]) - kinds);
    char* end = NULL;
    r.n = strtol(action + len + 1, &end, 10);
    if (r.error < 0 || *end != '\0' || (r.when == W_ALTERNATE && r.n != 2)) bad_rule(action);
  }
  rules[rule_count++] = r;
}

__attribute__((constructor)) static void read_rules(void) {
  const char* faults = getenv("RB_FAULT");
  if (faults == NULL) return;
  char* copy = strdup(faults);
  char* save = NULL;
  for (char* rule = strtok_r(copy, ",", &save); rule != NULL; rule = strtok_r(NULL, ",", &save)) {
    parse_rule(rule);
  }
  free(copy);
}

static void* real(const char* name) {
  void* fn = dlsym(RTLD_NEXT, name);
  if (fn == NULL) _exit(121);
  return fn;
}

static int fd_is(int fd, enum target target) {
  struct stat st;
  if (target == T_ANY) return 1;
  if (fstat(fd, &st) != 0) return 0;
  if (target == T_DEV) return S_ISBLK(st.st_mode);
  if (target != T_DATA || !S_ISREG(st.st_mode)) return 0;
  char link[64];
  char path[4096];
  snprintf(link, sizeof(link), "/proc/self/fd/%d", fd);
  ssize_t n = readlink(link, path, sizeof(path) - 1);
  return n > 6 && strncmp(path, "/data/", 6) == 0;
}

// The rule that applies to this call, or null; counts the call for every matching rule.
static struct rule* fault_for(enum call call, int fd, const char* path, int block) {
  struct rule* hit = NULL;
  for (int i = 0; i < rule_count; ++i) {
    struct rule* r = &rules[i];
    if (r->call != call) continue;
    if (call == C_FOPEN) {
      size_t len = path != NULL ? strlen(path) : 0;
      int is_misc = len >= 5 && strcmp(path + len - 5, "/misc") == 0;
      if (r->target != T_ANY && !(r->target == T_MISC && is_misc)) continue;
    } else if (call != C_FIBMAP && !fd_is(fd, r->target)) {
      continue;
    }
    long k = ++r->seen;
    int fires = r->when == W_SHORT || (r->when == W_ALTERNATE && k % 2 == 1) ||
                (r->when == W_NTH && k == r->n) || (r->when == W_FROM && k >= r->n) ||
                (r->when == W_BLOCK && block == r->n);
    if (fires && hit == NULL) hit = r;
  }
  return hit;
}

static int fail_with(int error) {
  errno = error;
  return -1;
}

static void trace_write(int fd, off64_t offset, ssize_t written) {
  const char* trace = getenv("RB_FAULT_TRACE");
  if (trace == NULL || written <= 0 || !fd_is(fd, T_DEV)) return;
  FILE* f = ((FILE * (*)(const char*, const char*)) real("fopen"))(trace, "a");
  if (f == NULL) return;
  fprintf(f, "%lld %zd\n", (long long)offset, written);
  fclose(f);
}

ssize_t read(int fd, void* buf, size_t count) {
  struct rule* r = fault_for(C_READ, fd, NULL, 0);
  if (r != NULL && r->when != W_SHORT) return fail_with(r->error);
  return ((ssize_t(*)(int, void*, size_t))real("read"))(fd, buf, count);
}

ssize_t pread64(int fd, void* buf, size_t count, off64_t offset) {
  struct rule* r = fault_for(C_READ, fd, NULL, 0);
  if (r != NULL && r->when != W_SHORT) return fail_with(r->error);
  return ((ssize_t(*)(int, void*, size_t, off64_t))real("pread64"))(fd, buf, count, offset);
}

ssize_t pread(int fd, void* buf, size_t count, off_t offset) {
  return pread64(fd, buf, count, offset);
}

static size_t write_size(struct rule* r, size_t count) {
  return r != NULL && r->when == W_SHORT && count > 1 ? count / 2 : count;
}

ssize_t write(int fd, const void* buf, size_t count) {
  struct rule* r = fault_for(C_WRITE, fd, NULL, 0);
  if (r != NULL && r->when != W_SHORT) return fail_with(r->error);
  off64_t at = lseek64(fd, 0, SEEK_CUR);
  ssize_t n = ((ssize_t(*)(int, const void*, size_t))real("write"))(fd, buf, write_size(r, count));
  trace_write(fd, at, n);
  return n;
}

ssize_t pwrite64(int fd, const void* buf, size_t count, off64_t offset) {
  struct rule* r = fault_for(C_WRITE, fd, NULL, 0);
  if (r != NULL && r->when != W_SHORT) return fail_with(r->error);
  ssize_t n = ((ssize_t(*)(int, const void*, size_t, off64_t))real("pwrite64"))(
      fd, buf, write_size(r, count), offset);
  trace_write(fd, offset, n);
  return n;
}

ssize_t pwrite(int fd, const void* buf, size_t count, off_t offset) {
  return pwrite64(fd, buf, count, offset);
}

off64_t lseek64(int fd, off64_t offset, int whence) {
  // The write tracer asks for the position; that is not the tool's call.
  if (!(offset == 0 && whence == SEEK_CUR)) {
    struct rule* r = fault_for(C_LSEEK, fd, NULL, 0);
    if (r != NULL) return fail_with(r->error);
  }
  return ((off64_t(*)(int, off64_t, int))real("lseek64"))(fd, offset, whence);
}

off_t lseek(int fd, off_t offset, int whence) { return lseek64(fd, offset, whence); }

static FILE* open_stream(const char* name, const char* path, const char* mode) {
  struct rule* r = fault_for(C_FOPEN, -1, path, 0);
  if (r != NULL) {
    errno = r->error;
    return NULL;
  }
  return ((FILE * (*)(const char*, const char*)) real(name))(path, mode);
}

FILE* fopen(const char* path, const char* mode) { return open_stream("fopen", path, mode); }
FILE* fopen64(const char* path, const char* mode) { return open_stream("fopen64", path, mode); }

int ioctl(int fd, unsigned long request, ...) {
  va_list ap;
  va_start(ap, request);
  void* arg = va_arg(ap, void*);
  va_end(ap);
  if (request == 1 /* FIBMAP */ && arg != NULL) {
    struct rule* r = fault_for(C_FIBMAP, fd, NULL, *(int*)arg);
    if (r != NULL) return fail_with(r->error);
  }
  return ((int (*)(int, unsigned long, void*))real("ioctl"))(fd, request, arg);
}
