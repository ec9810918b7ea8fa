// The device's mount table (fstab): the in-memory records every part of the tool shares, the
// text parser that makes them, and the default table built from the device tree and the
// hardware-named table file.
#pragma once

#include <stdint.h>
#include <stdio.h>

// One mount table line. Strings are heap strings owned by the table (released with free);
// records of a table whose input shrank between the parser's two passes stay zero-filled, so
// users must accept null strings.
struct fstab_rec {
  char* mount_source;
  char* mount_point;
  char* fs_type;
  unsigned long mount_flags;
  char* fs_options;
  int fs_mgr_flags;
  char* key_location;
  char* key_directory;
  char* verify_value;
  long long length;
  char* vold_label;
  int vold_partnum;
  int swap_prio;
  int max_comp_streams;
  unsigned int zram_size;
  uint64_t reserved_size;
  unsigned int file_contents_mode;
  unsigned int file_names_mode;
  unsigned int erase_blk_size;
  unsigned int logical_blk_size;
};

struct fstab {
  int num_entries;
  fstab_rec* recs;
  char* fstab_filename;  // null for a table parsed from a stream (the device-tree table)
};

// Bits of fs_mgr_flags (the fifth column).
#define MF_WAIT 0x1
#define MF_CHECK 0x2
#define MF_CRYPT 0x4
#define MF_NONREMOVABLE 0x8
#define MF_VOLDMANAGED 0x10
#define MF_LENGTH 0x20
#define MF_RECOVERYONLY 0x40
#define MF_SWAPPRIO 0x80
#define MF_ZRAMSIZE 0x100
#define MF_VERIFY 0x200
#define MF_FORCECRYPT 0x400
#define MF_NOEMULATEDSD 0x800
#define MF_NOTRIM 0x1000
#define MF_FILEENCRYPTION 0x2000
#define MF_FORMATTABLE 0x4000
#define MF_SLOTSELECT 0x8000
#define MF_FORCEFDEORFBE 0x10000
#define MF_LATEMOUNT 0x20000
#define MF_NOFAIL 0x40000
#define MF_VERIFYATBOOT 0x80000
#define MF_MAX_COMP_STREAMS 0x100000
#define MF_RESERVEDSIZE 0x200000
#define MF_QUOTA 0x400000
#define MF_ERASEBLKSIZE 0x800000
#define MF_LOGICALBLKSIZE 0x1000000
#define MF_AVB 0x2000000
#define MF_KEYDIRECTORY 0x4000000

// Encryption mode numbers of file_contents_mode and file_names_mode.
#define EM_UNKNOWN 0
#define EM_AES_256_XTS 1
#define EM_ICE 2
#define EM_AES_256_CTS 3
#define EM_AES_256_HEH 4

// Reads the table at path; the result carries a copy of path as its file name. Null on
// failure, after logging why.
fstab* fs_mgr_read_fstab(const char* path);
// Parses a readable, seekable stream (it is rewound for the second pass and left open). The
// slot suffix has already been applied to the result.
fstab* fs_mgr_read_fstab_file(FILE* stream);
// The table that the device tree describes, or null.
fstab* fs_mgr_read_fstab_dt();
// Device-tree records first, then those of the hardware-named (or recovery) table file.
fstab* fs_mgr_read_fstab_default();
// Releases a table and its strings; null is ignored. verify_value is left allocated.
void fs_mgr_free_fstab(fstab* table);
// The record's encryptable=, forceencrypt= and forcefdeorfbe= bits (not 0 or 1).
int fs_mgr_is_encryptable(const fstab_rec* rec);

// The two option columns as the parser reads them; text is cut up in place. Column 4: returns
// the mount flags, and the options that are not mount flags go to out, joined with "," and cut
// to out_size bytes. Column 5: returns the fs_mgr flags and stores the options' values in
// rec's fields key_location to logical_blk_size, overwriting them.
int fs_mgr_parse_mount_options(char* text, char* out, size_t out_size);
int fs_mgr_parse_fs_mgr_options(char* text, fstab_rec* rec);
