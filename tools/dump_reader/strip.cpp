// ramdump_inspect strip: the payloads of a read-out joined in the read buffer, one write per read.
#include <errno.h>
#include <fcntl.h>
#include <inttypes.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>

#include "tools/dump_reader/cli.h"
#include "tools/dump_reader/commands.h"
#include "tools/dump_reader/readout_reader.h"

namespace {

const char kUsage[] =
    "usage: ramdump_inspect strip OUTPUT FILE\n"
    "Writes the dump stream of a read-out (RAMDUMP_OUTPUT) alone to FILE (\"-\": standard\n"
    "output): the payloads of its 4096-byte units joined, the chain block headers removed, for\n"
    "tools that read the records themselves. The first unit whose chain block magic is not\n"
    "\"BCho\" ends the data; a partial last unit is ignored. Both are reported.\n"
    "\n"
    "Exit status: 0 when every unit was written, 1 when the read-out is damaged or cannot be\n"
    "read or FILE cannot be written, 2 on a usage error.\n";

// FILE opened for writing, refused when it is the read-out itself (truncating it would lose it).
int open_target(const char* file, int readout_fd) {
  if (strcmp(file, "-") == 0) return STDOUT_FILENO;
  // A FIFO without a reader fails at once (ENXIO) instead of waiting for one.
  int fd = open(file, O_WRONLY | O_CREAT | O_NONBLOCK | O_CLOEXEC | O_NOCTTY, 0644);
  if (fd < 0) {
    fail(file, errno == ENXIO ? "a FIFO without a reader" : strerror(errno));
    return -1;
  }
  struct stat in, out;
  std::string problem;
  const int flags = fcntl(fd, F_GETFL);
  if (flags < 0 || fcntl(fd, F_SETFL, flags & ~O_NONBLOCK) != 0 || fstat(fd, &out) != 0 ||
      fstat(readout_fd, &in) != 0) {
    problem = strerror(errno);
  } else if (in.st_dev == out.st_dev && in.st_ino == out.st_ino) {
    problem = "is the read-out itself";
  } else if (S_ISREG(out.st_mode) && ftruncate(fd, 0) != 0) {
    problem = strerror(errno);
  }
  if (problem.empty()) return fd;
  close(fd);
  fail(file, problem);
  return -1;
}

}  // namespace

int cmd_strip(int argc, char** argv) {
  if (wants_help(argc, argv)) {
    fputs(kUsage, stdout);
    return kExitOk;
  }
  static const char* const kFlags[] = {nullptr};
  unsigned seen;
  std::vector<const char*> operands;
  if (!split_args(argc, argv, kFlags, kUsage, &seen, &operands)) return kExitUsage;
  if (operands.size() != 2) return usage_error(kUsage, "strip takes OUTPUT and FILE");
  const char *path = operands[0], *file = operands[1];

  readout_reader reader;
  if (readout_open(&reader, path, "strip") != 0) return kExitBad;
  const int fd = open_target(file, reader.fd);
  if (fd < 0) {
    readout_close(&reader);
    return kExitBad;
  }
  uint8_t* units;
  bool write_failed = false;
  for (size_t count; !write_failed && (count = readout_next(&reader, &units)) > 0;) {
    if (write_all(fd, units, join_payloads(units, count)) != 0) {
      write_failed = true;
      fail(file, std::string("write failed: ") + strerror(errno));
    }
  }
  if (fd != STDOUT_FILENO && close(fd) != 0 && !write_failed) {
    write_failed = true;
    fail(file, std::string("write failed: ") + strerror(errno));
  }
  if (!write_failed && fd != STDOUT_FILENO) {
    printf("%s: %" PRIu64 " bytes of dump stream from %" PRIu64 " units\n", file,
           reader.units * UNIT_PAYLOAD_SIZE, reader.units);
  }
  const int status = readout_close(&reader);
  return write_failed ? kExitBad : status;
}
