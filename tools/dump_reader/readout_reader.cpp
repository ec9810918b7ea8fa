#include "tools/dump_reader/readout_reader.h"

#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include "ramdump/le_bytes.h"

namespace {

constexpr size_t kReadSize = READ_UNITS * UNIT_SIZE;

std::string hex32(uint32_t v) {
  char text[16];
  snprintf(text, sizeof(text), "%08x", v);
  return text;
}

}  // namespace

int readout_open(readout_reader* r, const char* path, const char* what) {
  r->path = path;
  struct stat st = {};
  r->fd = open_input(path, &st);
  if (r->fd < 0) {
    fail(path, strerror(errno));
    return -1;
  }
  if (S_ISDIR(st.st_mode)) {
    const std::string why = "is a directory";
    close(r->fd);
    r->fd = -1;
    fail(path, why);
    return -1;
  }
  // A regular file's partial last unit is reported even when the reading stops before it.
  if (S_ISREG(st.st_mode)) {
    r->size = static_cast<uint64_t>(st.st_size);
    r->partial = r->size % UNIT_SIZE;
    r->partial_offset = r->size - r->partial;
  }
  posix_fadvise(r->fd, 0, 0, POSIX_FADV_SEQUENTIAL);
  // A small read-out gets a buffer of its own size.
  r->capacity = kReadSize;
  if (S_ISREG(st.st_mode) && r->size < kReadSize) {
    r->capacity = (r->size / UNIT_SIZE + 1) * UNIT_SIZE;
  }
  if (posix_memalign(reinterpret_cast<void**>(&r->buffer), UNIT_SIZE, r->capacity) != 0) {
    close(r->fd);
    r->fd = -1;
    fail(path, "out of memory");
    return -1;
  }
  r->prog = progress_begin(what, r->size);
  return 0;
}

size_t readout_next(readout_reader* r, uint8_t** units) {
  if (r->done) return 0;
  size_t have = 0;
  while (have < r->capacity) {
    ssize_t n = read(r->fd, r->buffer + have, r->capacity - have);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) {
      r->read_errno = errno;
      r->done = true;
      break;
    }
    if (n == 0) {
      r->done = true;
      break;
    }
    have += static_cast<size_t>(n);
  }
  const uint64_t start = r->offset;
  r->offset += have;
  progress_update(&r->prog, r->offset);
  size_t count = have / UNIT_SIZE;
  if (r->done && r->read_errno == 0 && have % UNIT_SIZE != 0) {
    r->partial = have % UNIT_SIZE;
    r->partial_offset = r->offset - r->partial;
  }
  for (size_t i = 0; i < count; ++i) {
    const uint32_t magic = get_le32(r->buffer + i * UNIT_SIZE);
    if (magic != CHAIN_BLOCK_MAGIC) {
      r->bad_chain_magic = true;
      r->chain_magic = magic;
      r->offset = start + i * UNIT_SIZE;
      r->done = true;
      count = i;
      break;
    }
  }
  r->units += count;
  *units = r->buffer;
  return count;
}

std::string readout_stop_text(const readout_reader& r) {
  if (r.bad_chain_magic) {
    return "unit " + std::to_string(r.units) + " at offset " + std::to_string(r.offset) +
           " has chain block magic " + hex32(r.chain_magic) + ", not " + hex32(CHAIN_BLOCK_MAGIC) +
           " (\"BCho\")";
  }
  if (r.read_errno != 0) {
    return "read failed near offset " + std::to_string(r.offset) + ": " + strerror(r.read_errno);
  }
  return "";
}

int readout_close(readout_reader* r) {
  progress_end(&r->prog);
  if (r->partial > 0) {
    fail(r->path, "ends in a partial unit of " + std::to_string(r->partial) + " bytes at offset " +
                      std::to_string(r->partial_offset) +
                      " (not a multiple of 4096 bytes), ignored");
  }
  const std::string stop = readout_stop_text(*r);
  if (!stop.empty()) fail(r->path, stop + (r->bad_chain_magic ? ": the data ends there" : ""));
  if (r->fd >= 0) close(r->fd);
  free(r->buffer);
  r->fd = -1;
  r->buffer = nullptr;
  return readout_damaged(*r) ? kExitBad : kExitOk;
}

size_t join_payloads(uint8_t* units, size_t count) {
  for (size_t i = 0; i < count; ++i) {
    memmove(units + i * UNIT_PAYLOAD_SIZE, units + i * UNIT_SIZE + CHAIN_BLOCK_HEADER_SIZE,
            UNIT_PAYLOAD_SIZE);
  }
  return count * UNIT_PAYLOAD_SIZE;
}

int readout_parse(readout_reader* r, dump_stream* s, const dump_stream_sink& sink,
                  device_extraction* device) {
  uint8_t* units;
  for (size_t count; (count = readout_next(r, &units)) > 0;) {
    if (device == nullptr) {
      int rc = dump_stream_feed(s, units, join_payloads(units, count), sink);
      if (rc < 0) return rc;
    } else {
      for (size_t i = 0; i < count; ++i) {
        const uint8_t* unit = units + i * UNIT_SIZE;
        int rc = dump_stream_feed(s, unit + CHAIN_BLOCK_HEADER_SIZE, UNIT_PAYLOAD_SIZE, sink);
        if (rc < 0) return rc;
        device_extraction_feed(device, unit);
      }
    }
    // What follows the stream's end matters to neither.
    if (dump_stream_ended(*s) && (device == nullptr || device->stopped)) break;
  }
  // A bad chain magic counts only in a unit that the stream (or the model) reached, so the
  // result does not depend on where a read of READ_UNITS happened to end.
  if (r->bad_chain_magic && dump_stream_ended(*s)) {
    const uint64_t last = s->end_offset + (s->bad_magic_length > 0 ? s->bad_magic_length - 1 : 0);
    uint64_t reached = last / UNIT_PAYLOAD_SIZE + 1;
    if (device != nullptr && device->units > reached) reached = device->units;
    if (r->units >= reached) r->bad_chain_magic = false;  // r->units: the bad unit's index
  }
  return dump_stream_finish(s, sink);
}

int write_all(int fd, const uint8_t* data, size_t length) {
  while (length > 0) {
    ssize_t n = write(fd, data, length);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) {
      if (n == 0) errno = EIO;
      return -1;
    }
    data += n;
    length -= static_cast<size_t>(n);
  }
  return 0;
}
