// Reading a read-out (the chain blocks in chain order, as the tool copies them out) in large
// sequential pieces of whole 4096-byte units, as its extraction takes them apart: a partial last
// unit is ignored, and the first unit whose chain magic is not "BCho" ends the data.
#pragma once

#include <stddef.h>
#include <stdint.h>

#include <string>

#include "tools/dump_reader/cli.h"
#include "tools/dump_reader/dump_stream.h"

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

// The next whole units with a good chain magic (at most READ_UNITS), at *units, which the caller
// may change, valid until the next call: their count, 0 once the data has ended (at its end, a
// bad chain magic or a read error).
size_t readout_next(readout_reader* r, uint8_t** units);

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

// Moves the payloads of count units to the front of them, joined; returns their length.
size_t join_payloads(uint8_t* units, size_t count);

// The stream of a read-out run through a parser until the data ends, or until the stream has
// ended and so has the model of the tool's extraction when one is given. The model takes each
// unit as read, and the parser then takes the unit's payload; without a model the payloads of
// each read are joined first, so that a record's content in one read comes as one piece.
// A bad chain magic in a unit after the one where both ended is not a problem of the read-out.
// Returns 0, or the sink's first negative result.
int readout_parse(readout_reader* r, dump_stream* s, const dump_stream_sink& sink,
                  device_extraction* device);

// Writes all of length bytes, continuing after partial writes and interruptions. 0, or -1 with
// errno.
int write_all(int fd, const uint8_t* data, size_t length);
