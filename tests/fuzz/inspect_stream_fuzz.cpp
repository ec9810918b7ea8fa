// ramdump_inspect's dump stream parser and its model of the tool's message extraction. Byte 0
// bit 0 pads the last unit to a whole one, bytes 1 and 2 give a piece size, the rest is a dump
// stream. Fed in pieces, the stream must give the records, contents and end that it gives fed
// whole, with every content adding up to what its record's end reports and no gaps between
// records. Cut into units, the model must say RAMDUMP_MSG.txt comes out complete exactly when
// the real extraction writes a file of the size its last "Found file" line announced.
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <string>

#include "ramdump/dump_extract.h"
#include "tests/fuzz/fuzz_common.h"
#include "tools/ramdump_inspect/dump_stream.h"

namespace {

std::string base_dir, message;
unsigned long long found_size;  // what the real extraction last announced, when found
bool found;

struct recording {
  std::string events;
  uint64_t next_offset = 0, received = 0;
};

std::string parse(const std::string& stream, size_t piece) {
  recording rec;
  const dump_stream_sink sink = {
      &rec,
      [](void* ctx, const dump_stream_record& r) {
        recording& rec = *static_cast<recording*>(ctx);
        if (r.offset != rec.next_offset) abort();
        rec.events += "H" + std::to_string(r.size) + ":" +
                      std::string(reinterpret_cast<const char*>(r.name), sizeof(r.name));
        rec.received = 0;
        return 0;
      },
      [](void* ctx, const uint8_t* data, size_t length) {
        recording& rec = *static_cast<recording*>(ctx);
        rec.events.append(reinterpret_cast<const char*>(data), length);
        rec.received += length;
        return 0;
      },
      [](void* ctx, const dump_stream_record& r, bool complete, uint64_t received) {
        recording& rec = *static_cast<recording*>(ctx);
        if (received != rec.received || complete != (received == r.size)) abort();
        rec.next_offset = r.offset + DUMP_FILE_RECORD_SIZE + r.size;
        rec.events += "E" + std::to_string(received);
        return 0;
      }};
  dump_stream s;
  dump_stream_init(&s);
  for (size_t at = 0; at < stream.size(); at += piece) {
    dump_stream_feed(&s, reinterpret_cast<const uint8_t*>(stream.data()) + at,
                     std::min(piece, stream.size() - at), sink);
  }
  dump_stream_finish(&s, sink);
  return rec.events + "|" + std::to_string(s.end_offset) + " " + dump_stream_end_text(s);
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  fuzz_quiet_logging();
  __android_log_set_logger([](const struct __android_logger_data*, const char* text) {
    found |= sscanf(text, "Found file '%*[^']', size %llu", &found_size) == 1;
  });
  base_dir = fuzz_scratch_dir();
  message = base_dir + "/RAMDUMP_MSG.txt";
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 3) return 0;
  const std::string stream(reinterpret_cast<const char*>(data) + 3, size - 3);
  if (parse(stream, stream.size() + 1) != parse(stream, 1 + ((data[1] | data[2] << 8) & 0x1FFF))) {
    abort();
  }
  std::string readout;
  device_extraction device;
  device_extraction_init(&device);
  for (size_t at = 0; at < stream.size(); at += UNIT_PAYLOAD_SIZE) {
    std::string unit = "BCho" + std::string(12, '\0') + stream.substr(at, UNIT_PAYLOAD_SIZE);
    if ((data[0] & 1) != 0) unit.resize(UNIT_SIZE, '\0');
    if (unit.size() == UNIT_SIZE)
      device_extraction_feed(&device, reinterpret_cast<const uint8_t*>(unit.data()));
    readout += unit;
  }
  reset_dump_filter_state_for_test();
  found = false;
  fuzz_extract(readout, base_dir);
  struct stat st;
  const bool real = found && stat(message.c_str(), &st) == 0 &&
                    static_cast<unsigned long long>(st.st_size) == found_size;
  if (real != device.message_complete) abort();
  unlink(message.c_str());
  return 0;
}
