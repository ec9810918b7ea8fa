// Fault injection for tests/fault, preloaded (LD_PRELOAD): RB_FAULT=RULE[,RULE...] makes calls
// fail or come up short, RULE = CALL[.TARGET]=ACTION with
//   CALL    read, write, lseek (lseek64), fopen, openat, flock, fibmap (the FIBMAP ioctl)
//   TARGET  dev: a block device; data: a regular file under /data (fopen, openat: a path that
//           begins with "/data/"); misc: a path ending in "/misc"; none: every call
//   ACTION  ERR%n: matching calls 1, n+1, 2n+1... fail with ERR; ERR#k: the k-th one fails;
//           ERR+k: the k-th and every later one; ERR@b (fibmap): the mapping of logical block b
//           fails, leaving b in place; short (write): half of what was asked is written
//   ERR     EINTR, EIO, ENOSPC, EINVAL or ENOENT
// A rule that cannot be read ends the program with status 120, and every fault applied is
// reported on standard error, so that no test passes because its fault did not apply. With
// RB_FAULT_TRACE naming a file, every read() and write() that reaches a block device is appended
// to it as "r offset length" or "w offset length" (offset -1 when it cannot be told).
#define _GNU_SOURCE
#include <dlfcn.h>
#include <errno.h>
#include <fcntl.h>
#include <stdarg.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#define REAL(fn) ((__typeof__(&fn))dlsym(RTLD_NEXT, #fn))

static struct rule {
  char call[8], target[8], kind;
  int error;
  long n, seen;  // seen: matching calls so far
} rules[8];
static int rule_count;

static int parse_rule(const char* text, struct rule* r) {
  static const char* const names[] = {"EINTR", "EIO", "ENOSPC", "EINVAL", "ENOENT"};
  static const int values[] = {EINTR, EIO, ENOSPC, EINVAL, ENOENT};
  char action[32] = "", error[16] = "", call[16], target[16];
  int end = 0;
  if (sscanf(text, "%7[a-z].%7[a-z]=%31s", r->call, r->target, action) != 3 &&
      sscanf(text, "%7[a-z]=%31s", r->call, action) != 2) {
    return 0;
  }
  snprintf(call, sizeof(call), "|%s|", r->call);
  snprintf(target, sizeof(target), "|%s|", r->target);
  if (!strstr("|read|write|lseek|fopen|openat|flock|fibmap|", call) ||
      !strstr("||dev|data|misc|", target)) {
    return 0;
  }
  if (strcmp(action, "short") == 0) {
    r->kind = 's';
    return strcmp(r->call, "write") == 0;
  }
  if (sscanf(action, "%15[A-Z]%c%ld%n", error, &r->kind, &r->n, &end) != 3 || action[end] != '\0' ||
      !strchr("%#+@", r->kind) || r->n < (r->kind == '@' ? 0 : 1)) {
    return 0;
  }
  for (int i = 0; i < 5; ++i) {
    if (strcmp(error, names[i]) == 0) r->error = values[i];
  }
  return r->error != 0;
}

__attribute__((constructor)) static void read_rules(void) {
  const char* env = getenv("RB_FAULT");
  char copy[512];
  char* save = NULL;
  snprintf(copy, sizeof(copy), "%s", env != NULL ? env : "");
  for (char* text = strtok_r(copy, ",", &save); text != NULL; text = strtok_r(NULL, ",", &save)) {
    if (rule_count == 8 || !parse_rule(text, &rules[rule_count++])) {
      fprintf(stderr, "fault_inject: cannot read rule '%s'\n", text);
      _exit(120);
    }
  }
}

static int is_target(const char* target, int fd, const char* path) {
  struct stat st;
  char link[64], where[4096] = "";
  size_t len = path != NULL ? strlen(path) : 0;
  if (target[0] == '\0') return 1;
  if (strcmp(target, "misc") == 0) return len >= 5 && strcmp(path + len - 5, "/misc") == 0;
  if (path != NULL) return strcmp(target, "data") == 0 && strncmp(path, "/data/", 6) == 0;
  if (fd < 0 || fstat(fd, &st) != 0) return 0;
  if (strcmp(target, "dev") == 0) return S_ISBLK(st.st_mode);
  snprintf(link, sizeof(link), "/proc/self/fd/%d", fd);
  return S_ISREG(st.st_mode) && readlink(link, where, sizeof(where) - 1) > 6 &&
         strncmp(where, "/data/", 6) == 0;
}

// The first rule that fires for this call, or NULL; every matching rule counts the call.
static struct rule* fault(const char* call, int fd, const char* path, long block) {
  struct rule* hit = NULL;
  for (struct rule* r = rules; r < rules + rule_count; ++r) {
    if (strcmp(r->call, call) != 0 || !is_target(r->target, fd, path)) continue;
    long k = ++r->seen;
    int fires = r->kind == 's' || (r->kind == '%' && (k - 1) % r->n == 0) ||
                (r->kind == '#' && k == r->n) || (r->kind == '+' && k >= r->n) ||
                (r->kind == '@' && block == r->n);
    if (fires && hit == NULL) hit = r;
  }
  if (hit != NULL) dprintf(2, "fault_inject: %s\n", call);  // shows that the rule applied
  return hit;
}

#define UNTRACED (-2)

// Where a transfer on a block device starts, or UNTRACED.
static off64_t trace_start(int fd) {
  return getenv("RB_FAULT_TRACE") != NULL && is_target("dev", fd, NULL)
             ? REAL(lseek64)(fd, 0, SEEK_CUR)
             : UNTRACED;
}

static ssize_t trace(char kind, off64_t at, ssize_t n) {
  FILE* f;
  if (at != UNTRACED && n > 0 && (f = REAL(fopen)(getenv("RB_FAULT_TRACE"), "a")) != NULL) {
    fprintf(f, "%c %lld %zd\n", kind, (long long)at, n);
    fclose(f);
  }
  return n;
}

ssize_t read(int fd, void* buf, size_t count) {
  struct rule* r = fault("read", fd, NULL, -1);
  if (r != NULL) return (errno = r->error, -1);
  const off64_t at = trace_start(fd);
  return trace('r', at, REAL(read)(fd, buf, count));
}

ssize_t write(int fd, const void* buf, size_t count) {
  struct rule* r = fault("write", fd, NULL, -1);
  if (r != NULL && r->kind != 's') return (errno = r->error, -1);
  const off64_t at = trace_start(fd);
  return trace('w', at, REAL(write)(fd, buf, r != NULL && count > 1 ? count / 2 : count));
}

off64_t lseek64(int fd, off64_t offset, int whence) {
  struct rule* r = fault("lseek", fd, NULL, -1);
  return r != NULL ? (errno = r->error, -1) : REAL(lseek64)(fd, offset, whence);
}

FILE* fopen(const char* path, const char* mode) {
  struct rule* r = fault("fopen", -1, path, -1);
  if (r != NULL) errno = r->error;
  return r != NULL ? NULL : REAL(fopen)(path, mode);
}

int openat(int dir, const char* path, int flags, ...) {
  va_list ap;
  va_start(ap, flags);
  mode_t mode = (flags & O_CREAT) != 0 || (flags & O_TMPFILE) == O_TMPFILE ? va_arg(ap, mode_t) : 0;
  va_end(ap);
  struct rule* r = fault("openat", -1, path, -1);
  return r != NULL ? (errno = r->error, -1) : REAL(openat)(dir, path, flags, mode);
}

int flock(int fd, int operation) {
  struct rule* r = fault("flock", fd, NULL, -1);
  return r != NULL ? (errno = r->error, -1) : REAL(flock)(fd, operation);
}

int ioctl(int fd, unsigned long request, ...) {
  va_list ap;
  va_start(ap, request);
  int* arg = va_arg(ap, int*);
  va_end(ap);
  struct rule* r =
      request == 1 /* FIBMAP */ && arg != NULL ? fault("fibmap", fd, NULL, *arg) : NULL;
  return r != NULL ? (errno = r->error, -1) : REAL(ioctl)(fd, request, arg);
}
