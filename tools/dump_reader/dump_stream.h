// The dump stream of a read-out, parsed the way the firmware wrote it: record headers and
// contents reassembled wherever they cross a unit boundary, in one pass and in constant memory.
// Also a model of the tool's own message extraction, which reassembles record headers that
// start 17 to 39 bytes before the end of a unit's payload wrongly, so that a reader can say
// whether the device got RAMDUMP_MSG.txt out of the same read-out.
#pragma once

#include <stddef.h>
#include <stdint.h>

#include <string>
#include <unordered_map>

#include "ramdump/chain_format.h"

// The read-out is taken in 4096-byte units whatever block size the chain was armed with, as the
// tool's extraction does: a 16-byte chain block header, then the payload.
constexpr size_t UNIT_SIZE = 4096;
constexpr size_t UNIT_PAYLOAD_SIZE = UNIT_SIZE - CHAIN_BLOCK_HEADER_SIZE;

struct dump_stream_record {
  uint64_t index;   // 0 for the first record of the stream
  uint64_t offset;  // stream offset of the record header
  uint64_t size;
  uint8_t name[DUMP_FILE_NAME_SIZE];  // as stored, not necessarily terminated
};

// What a parser reports. Each returns 0 to go on, or a negative value that stops the feed and
// is returned from it. Content pieces point into the caller's data and are only valid until
// the caller reuses it. Any of the three may be null.
struct dump_stream_sink {
  void* ctx;
  int (*header)(void* ctx, const dump_stream_record& r);
  int (*content)(void* ctx, const uint8_t* data, size_t length);
  // After the last content byte, or at dump_stream_finish for a record that the data cut
  // short (complete false, received < size).
  int (*record_end)(void* ctx, const dump_stream_record& r, bool complete, uint64_t received);
};

enum dump_stream_state {
  STREAM_HEADER,       // between records, header_have bytes of the next header taken
  STREAM_CONTENT,      // inside the current record's content
  STREAM_BAD_MAGIC,    // ended: a record header whose magic is not "F1Le"
  STREAM_END_OF_DATA,  // ended by dump_stream_finish at a record boundary
  STREAM_CUT_HEADER,   // ended by dump_stream_finish inside a record header
  STREAM_CUT_CONTENT,  // ended by dump_stream_finish inside a record's content
};

struct dump_stream {
  dump_stream_state state;
  uint64_t offset;   // stream bytes taken so far
  uint64_t records;  // record headers taken so far
  uint8_t header[DUMP_FILE_RECORD_SIZE];
  size_t header_have;
  dump_stream_record current;
  uint64_t content_left;
  uint8_t bad_magic[4];  // the magic bytes found, for STREAM_BAD_MAGIC
  size_t bad_magic_length;
  uint64_t end_offset;  // where the stream ended: the bad or cut header, or the end of the data
};

void dump_stream_init(dump_stream* s);

// Takes the next length bytes of the stream, in any split. Bytes after the end of the stream
// are ignored. Returns 0, or the first negative result of a sink call.
int dump_stream_feed(dump_stream* s, const uint8_t* data, size_t length,
                     const dump_stream_sink& sink);

// The data has ended: reports a record cut short, settles the end state. Returns 0 or the
// sink's negative result.
int dump_stream_finish(dump_stream* s, const dump_stream_sink& sink);

// True once the stream has ended and further bytes are ignored.
inline bool dump_stream_ended(const dump_stream& s) { return s.state >= STREAM_BAD_MAGIC; }

// Why the stream ended, for people ("record magic "\x00..." is not "F1Le"") and for JSON.
std::string dump_stream_end_text(const dump_stream& s);
const char* dump_stream_end_token(const dump_stream& s);

// Record names. A name runs up to its terminator or over all 20 bytes when it has none.
enum name_problem {
  NAME_NO_TERMINATOR = 1,
  NAME_UNSAFE = 2,  // empty, "." or "..", or holds "/", a control character or a non-ASCII byte
};
std::string record_name(const dump_stream_record& r);
unsigned record_name_problems(const dump_stream_record& r);
// The name under which a record may be written into a directory: the name itself when it has no
// problem, otherwise its bytes with every unsafe one as '_', or "record_<offset>" where that
// leaves nothing usable; a name without terminator gets a '_' appended.
std::string record_file_name(const dump_stream_record& r);

// Names met so far, each with flags of the caller's. Bounded so that a stream of millions of
// tiny records keeps memory constant: past kMaxNames distinct names, new ones are not
// remembered and `full` is set.
struct name_set {
  static constexpr size_t kMaxNames = 32768;
  std::unordered_map<std::string, unsigned> names;
  bool full = false;
};
// The flags of a name, a new one's starting at 0; null when the set is full and the name is
// not in it.
unsigned* name_set_entry(name_set* set, const std::string& name);

// The tool's extraction of RAMDUMP_MSG.txt, replayed with its exact buffer arithmetic: each unit
// with a good chain magic is filtered behind the bytes carried from the unit before, and the
// bytes carried on are taken from the end of the unit as read, not from the end of its moved
// payload. Only positions are modelled; nothing is written.
struct device_extraction {
  bool stopped;    // the filter failed: the tool reads no further
  uint64_t units;  // units filtered
  uint8_t carry[DUMP_FILE_RECORD_SIZE];
  size_t carry_length;
  bool in_content;
  bool wanted;    // the current record is the message
  uint64_t left;  // content bytes of the current record still to come (the tool's signed count)
  bool message_open, message_complete;
  uint64_t stop_offset;  // stream offset of the header that stopped the filter
};

void device_extraction_init(device_extraction* d);
// One whole unit as read, its chain magic already found good.
void device_extraction_feed(device_extraction* d, const uint8_t unit[UNIT_SIZE]);
