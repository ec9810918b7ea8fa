// The option lists of both option columns. The first byte chooses the column and, for the
// mount options, the size of the buffer that collects the options it does not know.
#include "fs_mgr/fs_mgr_fstab.h"
#include "tests/fuzz/fuzz_common.h"

extern "C" int LLVMFuzzerInitialize(int*, char***) { return fuzz_quiet_logging(); }

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size == 0) return 0;
  const uint8_t mode = data[0];
  // Buffers exactly as long as their content, so that the sanitizers see any access past it.
  char* text = strndup(reinterpret_cast<const char*>(data + 1), size - 1);
  if ((mode & 1) == 0) {
    // Buffers of 0 to 63 bytes test the cutting; the parser itself uses 1024.
    const size_t out_size = (mode >> 1) < 64 ? (mode >> 1) : 1024;
    char* out = static_cast<char*>(malloc(out_size));
    fs_mgr_parse_mount_options(text, out, out_size);
    if (out_size > 0 && strnlen(out, out_size) == out_size) abort();  // not terminated
    free(out);
  } else if (!has_intended_size_overflow(data + 1, size - 1)) {
    fstab_rec rec = {};
    fs_mgr_parse_fs_mgr_options(text, &rec);
    for (char* s : {rec.key_location, rec.key_directory, rec.verify_value, rec.vold_label}) free(s);
  }
  free(text);
  return 0;
}
