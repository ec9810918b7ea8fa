#include "tools/dump_reader/dump_stream.h"

#include <string.h>

#include "ramdump/le_bytes.h"
#include "tools/dump_reader/cli.h"

namespace {

// "F1Le" in storage order.
const uint8_t kRecordMagic[4] = {DUMP_FILE_MAGIC & 0xFF, (DUMP_FILE_MAGIC >> 8) & 0xFF,
                                 (DUMP_FILE_MAGIC >> 16) & 0xFF, DUMP_FILE_MAGIC >> 24};

// The name the tool's extraction looks for, terminator included in the comparison.
const char kMessageName[] = "RAMDUMP_MSG.txt";

size_t name_length(const dump_stream_record& r) {
  const void* nul = memchr(r.name, '\0', DUMP_FILE_NAME_SIZE);
  return nul == nullptr ? DUMP_FILE_NAME_SIZE : static_cast<const uint8_t*>(nul) - r.name;
}

bool safe_name_byte(uint8_t c) { return c >= 0x20 && c < 0x7F && c != '/'; }

int sink_record_end(const dump_stream_sink& sink, const dump_stream_record& r, bool complete,
                    uint64_t received) {
  return sink.record_end == nullptr ? 0 : sink.record_end(sink.ctx, r, complete, received);
}

// Ends the stream when the first `have` bytes of the header in s->header are not those of the
// record magic.
bool end_at_bad_magic(dump_stream* s, size_t have) {
  if (memcmp(s->header, kRecordMagic, have) == 0) return false;
  s->state = STREAM_BAD_MAGIC;
  s->end_offset = s->offset - s->header_have;
  memcpy(s->bad_magic, s->header, have);
  s->bad_magic_length = have;
  return true;
}

// Takes a record header that is complete in s->header.
int take_header(dump_stream* s, const dump_stream_sink& sink) {
  const dump_file_record h = decode_dump_file_record(s->header);
  dump_stream_record& r = s->current;
  r.index = s->records++;
  r.offset = s->offset - DUMP_FILE_RECORD_SIZE;
  r.size = h.size;
  memcpy(r.name, h.name, DUMP_FILE_NAME_SIZE);
  s->header_have = 0;
  s->content_left = h.size;
  s->state = STREAM_CONTENT;
  if (sink.header != nullptr) {
    int rc = sink.header(sink.ctx, r);
    if (rc < 0) return rc;
  }
  if (h.size > 0) return 0;
  s->state = STREAM_HEADER;
  return sink_record_end(sink, r, true, 0);
}

}  // namespace

void dump_stream_init(dump_stream* s) {
  memset(s, 0, sizeof(*s));
  s->state = STREAM_HEADER;
}

int dump_stream_feed(dump_stream* s, const uint8_t* data, size_t length,
                     const dump_stream_sink& sink) {
  while (length > 0 && !dump_stream_ended(*s)) {
    if (s->state == STREAM_CONTENT) {
      const size_t n = s->content_left < length ? static_cast<size_t>(s->content_left) : length;
      if (sink.content != nullptr) {
        int rc = sink.content(sink.ctx, data, n);
        if (rc < 0) return rc;
      }
      data += n;
      length -= n;
      s->offset += n;
      s->content_left -= n;
      if (s->content_left == 0) {
        s->state = STREAM_HEADER;
        int rc = sink_record_end(sink, s->current, true, s->current.size);
        if (rc < 0) return rc;
      }
      continue;
    }
    const size_t n = DUMP_FILE_RECORD_SIZE - s->header_have < length
                         ? DUMP_FILE_RECORD_SIZE - s->header_have
                         : length;
    memcpy(s->header + s->header_have, data, n);
    if (s->header_have < sizeof(kRecordMagic) && s->header_have + n >= sizeof(kRecordMagic) &&
        end_at_bad_magic(s, sizeof(kRecordMagic))) {
      return 0;
    }
    s->header_have += n;
    s->offset += n;
    data += n;
    length -= n;
    if (s->header_have == DUMP_FILE_RECORD_SIZE) {
      int rc = take_header(s, sink);
      if (rc < 0) return rc;
    }
  }
  return 0;
}

int dump_stream_finish(dump_stream* s, const dump_stream_sink& sink) {
  switch (s->state) {
    case STREAM_HEADER:
      // One to three bytes at the end are judged on as much of the magic as they hold, so that
      // a stream ending in a few zeros ends at a bad magic rather than inside a header.
      if (s->header_have > 0 && s->header_have < sizeof(kRecordMagic) &&
          end_at_bad_magic(s, s->header_have)) {
        return 0;
      }
      s->state = s->header_have == 0 ? STREAM_END_OF_DATA : STREAM_CUT_HEADER;
      s->end_offset = s->offset - s->header_have;
      return 0;
    case STREAM_CONTENT:
      s->state = STREAM_CUT_CONTENT;
      s->end_offset = s->offset;
      return sink_record_end(sink, s->current, false, s->current.size - s->content_left);
    default:
      return 0;
  }
}

std::string dump_stream_end_text(const dump_stream& s) {
  switch (s.state) {
    case STREAM_BAD_MAGIC:
      return "record magic \"" +
             printable(
                 std::string(reinterpret_cast<const char*>(s.bad_magic), s.bad_magic_length)) +
             "\" is not \"F1Le\"";
    case STREAM_END_OF_DATA:
      return "end of the data";
    case STREAM_CUT_HEADER:
      return "the data ends inside a record header";
    case STREAM_CUT_CONTENT:
      return "the data ends inside a record";
    default:
      return "still open";
  }
}

const char* dump_stream_end_token(const dump_stream& s) {
  switch (s.state) {
    case STREAM_BAD_MAGIC:
      return "bad_magic";
    case STREAM_CUT_HEADER:
      return "cut_header";
    case STREAM_CUT_CONTENT:
      return "cut_record";
    default:
      return "end_of_data";
  }
}

std::string record_name(const dump_stream_record& r) {
  return std::string(reinterpret_cast<const char*>(r.name), name_length(r));
}

unsigned record_name_problems(const dump_stream_record& r) {
  const size_t n = name_length(r);
  unsigned problems = n == DUMP_FILE_NAME_SIZE ? NAME_NO_TERMINATOR : 0;
  const bool dots = r.name[0] == '.' && (n == 1 || (n == 2 && r.name[1] == '.'));
  if (n == 0 || dots) problems |= NAME_UNSAFE;
  for (size_t i = 0; i < n; ++i) {
    if (!safe_name_byte(r.name[i])) problems |= NAME_UNSAFE;
  }
  return problems;
}

std::string record_file_name(const dump_stream_record& r) {
  std::string name = record_name(r);
  for (char& c : name) {
    if (!safe_name_byte(static_cast<uint8_t>(c))) c = '_';
  }
  if (name.empty() || name == "." || name == "..") {
    name = "record_" + std::to_string(r.offset);
  }
  // All 20 bytes without a terminator may be a name cut short: the file name says so.
  if (record_name_problems(r) & NAME_NO_TERMINATOR) name += '_';
  return name;
}

unsigned* name_set_entry(name_set* set, const std::string& name) {
  auto it = set->names.find(name);
  if (it != set->names.end()) return &it->second;
  if (set->names.size() >= name_set::kMaxNames) {
    set->full = true;
    return nullptr;
  }
  return &set->names.emplace(name, 0).first->second;
}

namespace {

// The tool's filter taking one record header at stream offset `at`. False when it fails there.
bool device_header(device_extraction* d, const uint8_t* bytes, uint64_t at) {
  const dump_file_record h = decode_dump_file_record(bytes);
  if (h.magic != DUMP_FILE_MAGIC) {
    d->stopped = true;
    d->stop_offset = at;
    return false;
  }
  d->in_content = true;
  d->left = h.size > static_cast<uint64_t>(INT64_MAX) ? INT64_MAX : h.size;
  d->wanted = memcmp(h.name, kMessageName, sizeof(kMessageName)) == 0;
  if (d->wanted) {  // opened for writing, truncating an earlier copy; empty is already whole
    d->message_open = h.size > 0;
    d->message_complete = h.size == 0;
  }
  return true;
}

}  // namespace

void device_extraction_init(device_extraction* d) { memset(d, 0, sizeof(*d)); }

void device_extraction_feed(device_extraction* d, const uint8_t unit[UNIT_SIZE]) {
  if (d->stopped) return;
  const uint8_t* payload = unit + CHAIN_BLOCK_HEADER_SIZE;
  const uint64_t base = d->units * UNIT_PAYLOAD_SIZE;  // stream offset of payload[0]
  ++d->units;
  size_t pos = 0;
  // Carried bytes only ever start a record header, which the payload completes.
  if (d->carry_length > 0) {
    uint8_t header[DUMP_FILE_RECORD_SIZE];
    const size_t rest = DUMP_FILE_RECORD_SIZE - d->carry_length;
    memcpy(header, d->carry, d->carry_length);
    memcpy(header + d->carry_length, payload, rest);
    if (!device_header(d, header, base - d->carry_length)) return;
    d->carry_length = 0;
    pos = rest;
  }
  while (pos < UNIT_PAYLOAD_SIZE) {
    const size_t length = UNIT_PAYLOAD_SIZE - pos;
    if (d->in_content) {
      const size_t n = d->left < length ? static_cast<size_t>(d->left) : length;
      // A write of zero bytes is never reported as done: a wanted record of size 0 fails the
      // filter as soon as any data follows it.
      if (d->wanted && n == 0) {
        d->stopped = true;
        d->stop_offset = base + pos;
        return;
      }
      pos += n;
      d->left -= n;
      if (d->left == 0) {
        if (d->wanted) {
          d->message_open = false;
          d->message_complete = true;
        }
        d->in_content = false;
      }
      continue;
    }
    if (length < DUMP_FILE_RECORD_SIZE) {
      // Taken from the end of the unit's area: up to 16 bytes that is the payload's end, past
      // that the unit's own last 16 bytes follow bytes from before them.
      d->carry_length = length;
      if (length <= CHAIN_BLOCK_HEADER_SIZE) {
        memcpy(d->carry, unit + UNIT_SIZE - length, length);
      } else {
        const size_t early = length - CHAIN_BLOCK_HEADER_SIZE;
        memcpy(d->carry, unit + UNIT_SIZE + CHAIN_BLOCK_HEADER_SIZE - length, early);
        memcpy(d->carry + early, unit + UNIT_PAYLOAD_SIZE, CHAIN_BLOCK_HEADER_SIZE);
      }
      return;
    }
    if (!device_header(d, payload + pos, base + pos)) return;
    pos += DUMP_FILE_RECORD_SIZE;
  }
}
