// The mount table text parser on a memory stream, as the device-tree table reaches it.
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <vector>

#include "fs_mgr/fs_mgr_fstab.h"
#include "tests/fuzz/fuzz_common.h"

namespace {

// Parses the text and checks the table; false when the parser gave none.
bool parse(std::vector<char> text) {
  FILE* stream = fmemopen(text.data(), text.size(), "r");
  if (stream == nullptr) abort();
  fstab* table = fs_mgr_read_fstab_file(stream);
  fclose(stream);
  if (table == nullptr) return false;

  // The stream cannot change between the two passes, so every counted record is filled: a
  // null column here would mean the passes disagree about which lines are entries.
  if (table->num_entries < 1 || table->fstab_filename != nullptr) abort();
  for (int i = 0; i < table->num_entries; ++i) {
    const fstab_rec& rec = table->recs[i];
    if (rec.mount_source == nullptr || rec.mount_point == nullptr || rec.fs_type == nullptr) {
      abort();
    }
    if (strpbrk(rec.mount_point, " \t") != nullptr) abort();
    // The table's release leaves this one string to its owner.
    free(rec.verify_value);
  }
  fs_mgr_free_fstab(table);
  return true;
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  fuzz_quiet_logging();
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size == 0 || has_intended_size_overflow(data, size)) return 0;
  std::vector<char> text(data, data + size);
  // A table given up after a bad line keeps the "verify=" values of the records before it (its
  // release never frees them, by design). So a text naming "verify" is first parsed with the
  // word spoilt, which changes neither the lines nor the columns: only a text that then parses
  // is parsed as it is, and must parse too.
  if (memmem(text.data(), text.size(), "verify", 6) != nullptr) {
    std::vector<char> spoilt = text;
    for (char* at = spoilt.data();
         (at = static_cast<char*>(memmem(at, spoilt.data() + spoilt.size() - at, "verify", 6)));) {
      at[1] = 'X';
    }
    if (!parse(spoilt)) return 0;
  }
  if (!parse(text) && memmem(text.data(), text.size(), "verify", 6) != nullptr) abort();
  return 0;
}
