// How the routines reach the files they work on. A path that a person typed is taken as it is,
// links and all. The boot-time run's fixed files are names inside directories it opened itself:
// they are never reached through a link, and only a regular file with no other link will do,
// because their blocks are written through the raw device and their content is copied into
// files that everyone may read. Either way, an open never waits for the other end of a FIFO.
#pragma once

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/types.h>

struct file_ref {
  const char* path;       // as messages show it
  const char* name;       // relative to dir_fd
  int dir_fd = AT_FDCWD;  // AT_FDCWD: the path as typed; -1: the directory could not be opened
  int dir_error = 0;      // why, when dir_fd is -1
  int fd = -1;            // once opened and verified: the file itself, which no rename replaces
};

inline file_ref typed_path(const char* path) { return {path, path}; }

// open(2) of the file (O_CLOEXEC and O_NOCTTY added). Inside a directory, a link fails with ELOOP,
// a directory with EISDIR, a regular file with other links with EMLINK, anything else with ENXIO
// (what a FIFO without a reader gives), and O_TRUNC applies only once the file has passed. Returns
// the descriptor, or -1 with errno set.
//
// A file held by its descriptor is not looked up again: the open returns a duplicate of that
// descriptor (opened for reading), whatever the flags.
int open_file(const file_ref& file, int flags, mode_t mode = 0);

// stat(2) of the file; inside a directory, of the name itself rather than what a link names;
// fstat(2) of a held file.
int stat_file(const file_ref& file, struct stat* st);

// Whether a boot-time file that exists may be used; if not, logs why and returns false.
bool usable_fixed_file(const struct stat& st, const char* path);

// A directory below dir_fd, opened without following a link, or -1 with errno set.
int open_dir_at(int dir_fd, const char* name);
