// ramdump_inspect's model of the tool's message extraction against the real one. Byte 0 bit 0
// pads the last unit to a whole one, bytes 1 and 2 are unused, the rest is a dump stream. Cut into
// units, the model must say RAMDUMP_MSG.txt comes out complete exactly when the real extraction
// writes a file of the size its last "Found file" line announced.
#include "tests/fuzz/fuzz_common.h"
#include "tools/dump_reader/dump_stream.h"

namespace {

std::string base_dir, message;
unsigned long long found_size;  // what the real extraction last announced, when found
bool found;

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
  reset_dump_filter_state_for_test();
  found = false;
  const std::string readout = fuzz_extract(data + 3, size - 3, (data[0] & 1) != 0, base_dir);
  device_extraction device;
  device_extraction_init(&device);
  for (size_t at = 0; at + UNIT_SIZE <= readout.size(); at += UNIT_SIZE)
    device_extraction_feed(&device, reinterpret_cast<const uint8_t*>(readout.data() + at));
  struct stat st;
  if (device.message_complete != (found && stat(message.c_str(), &st) == 0 &&
                                  static_cast<unsigned long long>(st.st_size) == found_size))
    abort();
  unlink(message.c_str());
  return 0;
}
