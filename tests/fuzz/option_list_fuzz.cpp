// The option-list parser of both option columns. The first byte chooses the column and, for
// the mount options, the size of the buffer that collects the options it does not know.
#include <stdlib.h>
#include <string.h>

#include <vector>

#include "fs_mgr/fs_mgr_fstab.h"
#include "tests/fuzz/fuzz_common.h"

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  fuzz_quiet_logging();
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size == 0) return 0;
  const uint8_t mode = data[0];
  ++data;
  --size;
  // Exactly as long as the text, so that reading past its end shows under the sanitizers.
  char* text = static_cast<char*>(malloc(size + 1));
  memcpy(text, data, size);
  text[size] = '\0';

  if ((mode & 1) == 0) {
    // Small buffers (0 to 63 bytes) test the cutting; the parser itself uses 1024. A buffer of
    // size 0 must stay untouched.
    const size_t out_size = (mode >> 1) < 64 ? (mode >> 1) : 1024;
    char* out = static_cast<char*>(malloc(out_size + 1));
    out[out_size] = '\x5a';  // one guard byte the parser must never reach
    fs_mgr_parse_mount_options(text, out, out_size);
    if (out_size > 0 && strnlen(out, out_size) >= out_size) abort();
    if (out[out_size] != '\x5a') abort();
    free(out);
  } else if (!has_intended_size_overflow(data, size)) {
    fstab_rec rec;
    memset(&rec, 0, sizeof(rec));
    fs_mgr_parse_fs_mgr_options(text, &rec);
    free(rec.key_location);
    free(rec.key_directory);
    free(rec.verify_value);
    free(rec.vold_label);
  }
  free(text);
  return 0;
}
