// fstab_dump: prints a mount table as the reader parsed it, one field per line, so that the
// parser and the default table selection can be checked from outside the process.
//
//   fstab_dump FILE       the table in FILE (fs_mgr_read_fstab)
//   fstab_dump --default  the device's default table (fs_mgr_read_fstab_default)
#include <inttypes.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <string>
#include <vector>

#include "fs_mgr/fs_mgr_fstab.h"
#include "platform/log.h"

namespace {

// Quoted so that every byte of a string is visible and the output stays one line per field.
std::string quoted(const char* s) {
  if (s == nullptr) return "NULL";
  std::string out = "\"";
  for (const unsigned char* p = reinterpret_cast<const unsigned char*>(s); *p != '\0'; ++p) {
    if (*p == '\\' || *p == '"') {
      out += '\\';
      out += static_cast<char>(*p);
    } else if (*p < 0x20 || *p >= 0x7f) {
      char hex[5];
      snprintf(hex, sizeof(hex), "\\x%02x", *p);
      out += hex;
    } else {
      out += static_cast<char>(*p);
    }
  }
  return out + "\"";
}

void print_record(int i, const fstab_rec& r) {
  printf("rec[%d].mount_source=%s\n", i, quoted(r.mount_source).c_str());
  printf("rec[%d].mount_point=%s\n", i, quoted(r.mount_point).c_str());
  printf("rec[%d].fs_type=%s\n", i, quoted(r.fs_type).c_str());
  printf("rec[%d].mount_flags=0x%lx\n", i, r.mount_flags);
  printf("rec[%d].fs_options=%s\n", i, quoted(r.fs_options).c_str());
  printf("rec[%d].fs_mgr_flags=0x%x\n", i, static_cast<unsigned int>(r.fs_mgr_flags));
  printf("rec[%d].key_location=%s\n", i, quoted(r.key_location).c_str());
  printf("rec[%d].key_directory=%s\n", i, quoted(r.key_directory).c_str());
  printf("rec[%d].verify_value=%s\n", i, quoted(r.verify_value).c_str());
  printf("rec[%d].length=%lld\n", i, r.length);
  printf("rec[%d].vold_label=%s\n", i, quoted(r.vold_label).c_str());
  printf("rec[%d].vold_partnum=%d\n", i, r.vold_partnum);
  printf("rec[%d].swap_prio=%d\n", i, r.swap_prio);
  printf("rec[%d].max_comp_streams=%d\n", i, r.max_comp_streams);
  printf("rec[%d].zram_size=%u\n", i, r.zram_size);
  printf("rec[%d].reserved_size=%" PRIu64 "\n", i, r.reserved_size);
  printf("rec[%d].file_contents_mode=%u\n", i, r.file_contents_mode);
  printf("rec[%d].file_names_mode=%u\n", i, r.file_names_mode);
  printf("rec[%d].erase_blk_size=%u\n", i, r.erase_blk_size);
  printf("rec[%d].logical_blk_size=%u\n", i, r.logical_blk_size);
}

}  // namespace

int main(int argc, char** argv) {
  platform_init_logging();
  if (argc != 2 || (argv[1][0] == '-' && argv[1][1] != '\0' && strcmp(argv[1], "--default"))) {
    fprintf(stderr, "usage: fstab_dump FILE | fstab_dump --default\n");
    return 2;
  }
  fstab* table =
      strcmp(argv[1], "--default") == 0 ? fs_mgr_read_fstab_default() : fs_mgr_read_fstab(argv[1]);
  if (table == nullptr) {
    printf("NULL TABLE\n");
    return 1;
  }
  printf("num_entries=%d\n", table->num_entries);
  printf("fstab_filename=%s\n", quoted(table->fstab_filename).c_str());
  std::vector<char*> verify_values;
  for (int i = 0; i < table->num_entries; ++i) {
    print_record(i, table->recs[i]);
    verify_values.push_back(table->recs[i].verify_value);
  }
  // The table's release leaves verify_value allocated, so the tool frees those itself.
  fs_mgr_free_fstab(table);
  for (char* value : verify_values) free(value);
  return 0;
}
