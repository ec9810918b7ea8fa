// Reading a read-out (the chain blocks in chain order, as the tool copies them out) in large
// sequential pieces of whole 4096-byte units, as its extraction takes them apart: a partial last
// unit is ignored, and the first unit whose chain magic is not "BCho" ends the data.
#pragma once

#include <stddef.h>
#include <stdint.h>
#include <sys/uio.h>

#include <string>

#include "tools/ramdump_inspect/cli.h"
#include "tools/ramdump_inspect/dump_stream.h"

// Units per read: large enough that system calls cost nothing next to the copying, small enough
// to stay in the cache while they are parsed.
constexpr size_t READ_UNITS = 256;

struct readout_reader {
  std::string path;
  int fd = -1;
  uint8_t* buffer = nullptr;
  size_t capacity = 0;  // of the buffer, a multiple of UNIT_SIZE
  uint64_t size = 0;    // of a regular file, for progress; 0 otherwise
  uint64_t offset = 0;  // file offset of the next read
  uint64_t units = 0;   // whole good units handed out
  bool done = false;    // nothing more will be handed out
  size_t partial = 0;   // bytes of a partial last unit, ignored
  uint64_t partial_offset = 0;
  bool bad_chain_magic = false;
  uint32_t chain_magic = 0;  // what the bad unit held
  int read_errno = 0;
  progress prog = {};
};

// Opens path for sequential reading; on failure prints a one-line message and returns -1.
// `what` names the work in the progress line.
int readout_open(readout_reader* r, const char* path, const char* what);

// The next whole units with a good chain magic (at most READ_UNITS), at *units, valid until the
// next call: their count, 0 once the data has ended (at its end, a bad chain magic or a read
// error).
size_t readout_next(readout_reader* r, const uint8_t** units);

// Whether the read-out had a problem: a partial last unit, a bad chain magic or a read error.
inline bool readout_damaged(const readout_reader& r) {
  return r.partial > 0 || r.bad_chain_magic || r.read_errno != 0;
}

// Why the data ended early, for an end reason ("" when it did not): a bad chain magic or a read
// error.
std::string readout_stop_text(const readout_reader& r);

// Prints a one-line message for each problem, clears the progress line and releases the
// reader. Returns 1 when there was a problem, else 0.
int readout_close(readout_reader* r);

// The stream of a read-out run through a parser (and optionally the model of the tool's
// extraction) until the data ends or both have ended; chunk_end, when given, is called before
// the reader reuses the memory that the sink's content pieces point into. Returns 0, or the
// sink's first negative result.
int readout_parse(readout_reader* r, dump_stream* s, const dump_stream_sink& sink,
                  device_extraction* device, int (*chunk_end)(void* ctx));

// Writes all of count pieces (at most IOV_MAX) with as few system calls as the kernel allows,
// continuing after partial writes and interruptions; consumes the array. 0, or -1 with errno.
int write_pieces(int fd, iovec* pieces, size_t count);
