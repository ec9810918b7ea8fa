// fstab_dump: prints a mount table as the reader parsed it, one field per line, so that the
// parser, the default table selection and the block device lookup can be checked from outside
// the process. The usage text below lists the forms.
#include <inttypes.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <string>
#include <vector>

#include "fs_mgr/fs_mgr_fstab.h"
#include "platform/log.h"
#include "ramdump/block_device.h"

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

const char kUsage[] =
    "usage: fstab_dump FILE | fstab_dump --default | fstab_dump --find PATH\n"
    "Shows how reserveblocks reads a mount table: every record and field, one per line.\n"
    "  FILE         the table in FILE\n"
    "  --default    the device's default table: the device tree's records, then those of the\n"
    "               first of /odm/etc/fstab.<hardware>, /vendor/etc/fstab.<hardware> and\n"
    "               /fstab.<hardware> (/etc/recovery.fstab in recovery)\n"
    "  --find PATH  the record of the default table whose device the tool uses for PATH\n"
    "               (absolute, links resolved; the first record whose mount point holds it),\n"
    "               with whether it may be encrypted and whether it is\n"
    "  --help       this text\n"
    "The default table's paths are fixed: run it in a fake device root or on a device. The\n"
    "reader's messages go to /dev/__log__ where that file exists, else to standard error.\n";

int usage_error() {
  fputs(kUsage, stderr);
  return 2;
}

// The record that find_block_device chose: the one whose mount_source it returned.
int record_index(const fstab* table, const char* blk_dev) {
  for (int i = 0; i < table->num_entries; ++i) {
    if (table->recs[i].mount_source == blk_dev) return i;
  }
  return -1;
}

// The table's release leaves verify_value allocated, so the tool frees those itself.
void release(fstab* table) {
  std::vector<char*> verify_values;
  for (int i = 0; i < table->num_entries; ++i) verify_values.push_back(table->recs[i].verify_value);
  fs_mgr_free_fstab(table);
  for (char* value : verify_values) free(value);
}

}  // namespace

int main(int argc, char** argv) {
  platform_init_logging();
  const bool find = argc == 3 && strcmp(argv[1], "--find") == 0;
  if (argc == 2 && strcmp(argv[1], "--help") == 0) {
    fputs(kUsage, stdout);
    return 0;
  }
  if (find ? argv[2][0] != '/'
           : argc != 2 ||
                 (argv[1][0] == '-' && argv[1][1] != '\0' && strcmp(argv[1], "--default") != 0)) {
    return usage_error();
  }
  const bool from_file = !find && strcmp(argv[1], "--default") != 0;
  fstab* table = from_file ? fs_mgr_read_fstab(argv[1]) : fs_mgr_read_fstab_default();
  if (table == nullptr) {
    printf("NULL TABLE\n");
    if (from_file) {
      fprintf(stderr, "fstab_dump: %s: no mount table read (the reasons are logged)\n", argv[1]);
    } else {
      fprintf(stderr, "fstab_dump: no default mount table read (the reasons are logged)\n");
    }
    return 1;
  }
  int status = 0;
  if (find) {
    int encryptable = 0, encrypted = 0;
    const char* blk_dev = find_block_device(argv[2], table, &encryptable, &encrypted);
    if (blk_dev == nullptr) {
      fprintf(stderr, "fstab_dump: %s: no record of the default mount table holds it\n", argv[2]);
      status = 1;
    } else {
      const int i = record_index(table, blk_dev);
      printf("record=%d\nblock_device=%s\nencryptable=%d\nencrypted=%d\n", i,
             quoted(blk_dev).c_str(), encryptable, encrypted);
      print_record(i, table->recs[i]);
    }
  } else {
    printf("num_entries=%d\n", table->num_entries);
    printf("fstab_filename=%s\n", quoted(table->fstab_filename).c_str());
    for (int i = 0; i < table->num_entries; ++i) print_record(i, table->recs[i]);
  }
  release(table);
  return status;
}
