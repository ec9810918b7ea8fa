// The dump stream filter and the message extraction. Byte 0 even: the stream after byte 2 is fed
// to the filter in pieces (their size from bytes 1 and 2), the unused end of each call presented
// again in front of the next piece, as the filter's contract asks. Odd: the stream after byte 0
// is cut into a read-out (bit 1 pads the last unit) and extracted from it. Whatever the record
// names say, nothing but the message file may appear, and only in the output directory.
#include "tests/fuzz/fuzz_common.h"

namespace {

constexpr char kWanted[] = "RAMDUMP_MSG.txt";
std::string base_dir, out_dir, message;  // base_dir holds out_dir alone

void feed(const uint8_t* data, size_t size, size_t piece) {
  FILE* out = nullptr;
  std::string pending;
  for (size_t pos = 0; pos < size;) {
    const size_t n = size - pos < piece ? size - pos : piece;
    pending.append(reinterpret_cast<const char*>(data + pos), n);
    pos += n;
    const int64_t left =
        process_data_filtered(reinterpret_cast<const uint8_t*>(pending.data()),
                              static_cast<int64_t>(pending.size()), &out, kWanted, out_dir.c_str());
    if (left < 0) break;
    if (left >= static_cast<int64_t>(DUMP_FILE_RECORD_SIZE)) abort();  // a whole header unused
    pending.erase(0, pending.size() - static_cast<size_t>(left));
  }
  if (out != nullptr) fclose(out);
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  base_dir = fuzz_scratch_dir();
  out_dir = base_dir + "/out";
  message = out_dir + "/" + kWanted;
  if (mkdir(out_dir.c_str(), 0755) != 0) abort();
  return fuzz_quiet_logging();
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 3) return 0;
  reset_dump_filter_state_for_test();
  if ((data[0] & 1) != 0) {
    fuzz_extract(data + 1, size - 1, (data[0] & 2) != 0, out_dir);
  } else {
    feed(data + 3, size - 3, 1 + ((data[1] | data[2] << 8) & 0x1FFF));
  }
  for (const auto& entry : std::filesystem::recursive_directory_iterator(base_dir)) {
    if (entry.path() != out_dir && entry.path() != message) abort();
  }
  unlink(message.c_str());
  return 0;
}
