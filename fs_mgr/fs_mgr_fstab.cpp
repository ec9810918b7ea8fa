#include "fs_mgr/fs_mgr_fstab.h"

#include <android-base/logging.h>
#include <ctype.h>
#include <dirent.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mount.h>
#include <unistd.h>

#include <memory>
#include <string>

#include "fs_mgr/fs_mgr_boot_config.h"

// Every message of the mount table reader carries the library's tag in front of its text.
#define FS_MGR_TAG "[libfs_mgr]"
#define LINFO LOG(INFO) << FS_MGR_TAG
#define LWARNING LOG(WARNING) << FS_MGR_TAG
#define LERROR LOG(ERROR) << FS_MGR_TAG
#define PERROR PLOG(ERROR) << FS_MGR_TAG

namespace {

// What the fs_mgr option column stores besides its bits: the record's fields from key_location
// to logical_blk_size, filled while the column is read and then copied into the record.
struct fs_mgr_flag_values {
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

struct flag_list {
  const char* name;
  int flag;
};

// Options are matched by prefix and the first matching row wins, so the row order of these
// tables matters.
const flag_list mount_flag_list[] = {
    {"noatime", MS_NOATIME},
    {"noexec", MS_NOEXEC},
    {"nosuid", MS_NOSUID},
    {"nodev", MS_NODEV},
    {"nodiratime", MS_NODIRATIME},
    {"ro", MS_RDONLY},
    {"rw", 0},
    {"remount", MS_REMOUNT},
    {"bind", MS_BIND},
    {"rec", MS_REC},
    {"unbindable", MS_UNBINDABLE},
    {"private", MS_PRIVATE},
    {"slave", MS_SLAVE},
    {"shared", MS_SHARED},
    {"defaults", 0},
    {nullptr, 0},
};

// "verifyatboot" must come before "verify".
const flag_list fs_mgr_flag_list[] = {
    {"wait", MF_WAIT},
    {"check", MF_CHECK},
    {"encryptable=", MF_CRYPT},
    {"forceencrypt=", MF_FORCECRYPT},
    {"fileencryption=", MF_FILEENCRYPTION},
    {"forcefdeorfbe=", MF_FORCEFDEORFBE},
    {"keydirectory=", MF_KEYDIRECTORY},
    {"nonremovable", MF_NONREMOVABLE},
    {"voldmanaged=", MF_VOLDMANAGED},
    {"length=", MF_LENGTH},
    {"recoveryonly", MF_RECOVERYONLY},
    {"swapprio=", MF_SWAPPRIO},
    {"zramsize=", MF_ZRAMSIZE},
    {"max_comp_streams=", MF_MAX_COMP_STREAMS},
    {"verifyatboot", MF_VERIFYATBOOT},
    {"verify", MF_VERIFY},
    {"avb", MF_AVB},
    {"noemulatedsd", MF_NOEMULATEDSD},
    {"notrim", MF_NOTRIM},
    {"formattable", MF_FORMATTABLE},
    {"slotselect", MF_SLOTSELECT},
    {"nofail", MF_NOFAIL},
    {"latemount", MF_LATEMOUNT},
    {"reservedsize=", MF_RESERVEDSIZE},
    {"quota", MF_QUOTA},
    {"eraseblk=", MF_ERASEBLKSIZE},
    {"logicalblk=", MF_LOGICALBLKSIZE},
    {"defaults", 0},
    {nullptr, 0},
};

const flag_list file_contents_encryption_modes[] = {
    {"aes-256-xts", EM_AES_256_XTS},
    {"software", EM_AES_256_XTS}, /* alias for backwards compatibility */
    {"ice", EM_ICE},
    {nullptr, 0},
};

const flag_list file_names_encryption_modes[] = {
    {"aes-256-cts", EM_AES_256_CTS},
    {"aes-256-heh", EM_AES_256_HEH},
    {nullptr, 0},
};

// Mode tables are matched exactly, unlike the option tables.
unsigned int encryption_mode_to_flag(const flag_list* table, const char* mode, const char* type) {
  for (const flag_list* j = table; j->name != nullptr; ++j) {
    if (strcmp(mode, j->name) == 0) return static_cast<unsigned int>(j->flag);
  }
  LERROR << "Unknown " << type << " encryption mode: " << mode;
  return EM_UNKNOWN;
}

// Appends src to the NUL-terminated text in dst without ever writing past dst_size bytes;
// what does not fit is cut.
void bounded_append(char* dst, size_t dst_size, const char* src) {
  size_t used = strnlen(dst, dst_size);
  if (used + 1 >= dst_size) return;
  size_t room = dst_size - used - 1;
  size_t n = strnlen(src, room);
  memcpy(dst + used, src, n);
  dst[used + n] = '\0';
}

// A block size is only usable when it is a power of two of at least 4096 bytes; an unusable
// one is dropped, so the field keeps what an earlier option of the line gave it.
void set_block_size(unsigned int* field, const char* value) {
  unsigned int size = static_cast<unsigned int>(strtoul(value, nullptr, 0));
  if (size >= 4096 && (size & (size - 1)) == 0) *field = size;
}

uint64_t checked_mul(uint64_t a, uint64_t b) {
  uint64_t product;
  // A size that does not fit cannot be meant; carrying on with a wrapped value could
  // reserve or swap a wrong amount.
  if (__builtin_mul_overflow(a, b, &product)) abort();
  return product;
}

unsigned int zram_size_of(const char* item, const char* value) {
  long long n = strtoll(value, nullptr, 0);
  if (strchr(item, '%') == nullptr) return static_cast<unsigned int>(n);
  uint64_t pages = static_cast<uint64_t>(sysconf(_SC_PHYS_PAGES));
  uint64_t page_size = static_cast<uint64_t>(sysconf(_SC_PAGESIZE));
  uint64_t percent = static_cast<unsigned int>(n);
  return static_cast<unsigned int>(checked_mul(checked_mul(pages, percent) / 100, page_size));
}

uint64_t reserved_size_of(const char* value) {
  char* end = nullptr;
  uint64_t n = strtoull(value, &end, 10);
  uint64_t multiplier = 1;
  switch (*end) {
    case 'G':
    case 'g':
      multiplier = 1ULL << 30;
      break;
    case 'M':
    case 'm':
      multiplier = 1ULL << 20;
      break;
    case 'K':
    case 'k':
      multiplier = 1ULL << 10;
      break;
  }
  return checked_mul(n, multiplier);
}

// Replaces a string value so that an option given twice does not leak the first copy.
void set_string(char** field, const char* value) {
  free(*field);
  *field = strdup(value);
}

// Stores the value that the fs_mgr option row with the given flag carries.
void extract_value(int flag, char* item, fs_mgr_flag_values* values) {
  char* equals = strchr(item, '=');
  const char* value = equals != nullptr ? equals + 1 : "";
  switch (flag) {
    case MF_CRYPT:
    case MF_FORCECRYPT:
      set_string(&values->key_location, value);
      break;
    case MF_FORCEFDEORFBE:
      set_string(&values->key_location, value);
      values->file_contents_mode = EM_AES_256_XTS;
      values->file_names_mode = EM_AES_256_CTS;
      break;
    case MF_KEYDIRECTORY:
      set_string(&values->key_directory, value);
      break;
    case MF_VERIFY:
      if (equals != nullptr) set_string(&values->verify_value, value);
      break;
    case MF_LENGTH:
      values->length = strtoll(value, nullptr, 0);
      break;
    case MF_VOLDMANAGED: {
      char* colon = strchr(item, ':');
      if (colon == nullptr) {
        LERROR << "Warning: voldmanaged= flag malformed";
        break;
      }
      free(values->vold_label);
      values->vold_label = strndup(value, static_cast<size_t>(colon - value));
      const char* part = colon + 1;
      values->vold_partnum =
          strcmp(part, "auto") == 0 ? -1 : static_cast<int>(strtol(part, nullptr, 0));
      break;
    }
    case MF_SWAPPRIO:
      values->swap_prio = static_cast<int>(strtoll(value, nullptr, 0));
      break;
    case MF_MAX_COMP_STREAMS:
      values->max_comp_streams = static_cast<int>(strtoll(value, nullptr, 0));
      break;
    case MF_ZRAMSIZE:
      values->zram_size = zram_size_of(item, value);
      break;
    case MF_RESERVEDSIZE:
      values->reserved_size = reserved_size_of(value);
      break;
    case MF_FILEENCRYPTION: {
      // contents or contents:names; the names mode defaults to aes-256-cts.
      char* colon = strchr(equals + 1, ':');
      if (colon != nullptr) *colon = '\0';
      values->file_contents_mode =
          encryption_mode_to_flag(file_contents_encryption_modes, equals + 1, "file contents");
      values->file_names_mode =
          colon != nullptr
              ? encryption_mode_to_flag(file_names_encryption_modes, colon + 1, "file names")
              : EM_AES_256_CTS;
      break;
    }
    case MF_ERASEBLKSIZE:
      set_block_size(&values->erase_blk_size, value);
      break;
    case MF_LOGICALBLKSIZE:
      set_block_size(&values->logical_blk_size, value);
      break;
  }
}

// Cuts the comma-separated text in place and returns the OR of the matched rows' flags.
// Values are stored only when a carrier is given; unmatched items go to out when a buffer is
// given (bounded by out_size) and are otherwise reported.
int parse_flags(char* text, const flag_list* table, fs_mgr_flag_values* values, char* out,
                size_t out_size) {
  if (values != nullptr) {
    *values = fs_mgr_flag_values{};
    values->vold_partnum = -1;
    values->swap_prio = -1;
  }
  if (out != nullptr && out_size >= 1) out[0] = '\0';

  int result = 0;
  char* save = nullptr;
  for (char* item = strtok_r(text, ",", &save); item != nullptr;
       item = strtok_r(nullptr, ",", &save)) {
    const flag_list* row = table;
    while (row->name != nullptr && strncmp(item, row->name, strlen(row->name)) != 0) ++row;
    if (row->name != nullptr) {
      result |= row->flag;
      if (values != nullptr) extract_value(row->flag, item, values);
    } else if (out != nullptr) {
      bounded_append(out, out_size, item);
      bounded_append(out, out_size, ",");
    } else {
      LERROR << "Warning: unknown flag " << item;
    }
  }

  // Drops the separator after the last item, or the last kept character when the text was cut.
  if (out != nullptr && out_size >= 1 && out[0] != '\0') out[strlen(out) - 1] = '\0';
  return result;
}

// Strips the line feed and tells whether what is left is an entry (not blank, not a comment).
bool is_entry_line(char* line, ssize_t len) {
  if (len > 0 && line[len - 1] == '\n') line[len - 1] = '\0';
  const char* p = line;
  while (isspace(static_cast<unsigned char>(*p))) ++p;
  return *p != '\0' && *p != '#';
}

// Fills rec from an entry line; returns the message for the first missing column, or null.
const char* parse_entry(char* line, fstab_rec* rec) {
  static const char kDelim[] = " \t";
  char* save = nullptr;
  char* token = strtok_r(line, kDelim, &save);
  if (token == nullptr) return "Error parsing mount source";
  rec->mount_source = strdup(token);

  if ((token = strtok_r(nullptr, kDelim, &save)) == nullptr) return "Error parsing mount_point";
  rec->mount_point = strdup(token);

  if ((token = strtok_r(nullptr, kDelim, &save)) == nullptr) return "Error parsing fs_type";
  rec->fs_type = strdup(token);

  if ((token = strtok_r(nullptr, kDelim, &save)) == nullptr) return "Error parsing mount_flags";
  char options[1024];
  memset(options, 0, sizeof(options));
  int mount_flags = fs_mgr_parse_mount_options(token, options, sizeof(options));
  rec->mount_flags = static_cast<unsigned long>(static_cast<long>(mount_flags));
  rec->fs_options = options[0] != '\0' ? strdup(options) : nullptr;

  if ((token = strtok_r(nullptr, kDelim, &save)) == nullptr) return "Error parsing fs_mgr_options";
  rec->fs_mgr_flags = fs_mgr_parse_fs_mgr_options(token, rec);
  return nullptr;
}

// The device tree lists one subdirectory per partition under <dt dir>/fstab; each becomes one
// table line. Any incomplete entry discards the whole text, so that a half-described device
// tree never shadows the file table.
std::string read_fstab_text_from_dt() {
  if (!is_dt_compatible()) return "";
  const std::string fstab_dir = get_android_dt_dir() + "/fstab";
  std::string value;
  if (!read_dt_file(fstab_dir + "/compatible", &value) || value != "android,fstab") return "";

  std::unique_ptr<DIR, int (*)(DIR*)> dir(opendir(fstab_dir.c_str()), closedir);
  if (!dir) return "";
  std::string text;
  while (const dirent* entry = readdir(dir.get())) {
    if (entry->d_type != DT_DIR || entry->d_name[0] == '.') continue;
    const std::string name = entry->d_name;
    const std::string base = fstab_dir + "/" + name + "/";

    std::string status;
    if (read_dt_file(base + "status", &status) && status != "okay" && status != "ok") {
      LINFO << "dt_fstab: Skip disabled entry for partition " << name;
      continue;
    }
    std::string dev;
    if (!read_dt_file(base + "dev", &dev)) {
      LERROR << "dt_fstab: Failed to find device for partition " << name;
      return "";
    }
    std::string type, mnt_flags, fsmgr_flags;
    if (!read_dt_file(base + "type", &type) || !read_dt_file(base + "mnt_flags", &mnt_flags) ||
        !read_dt_file(base + "fsmgr_flags", &fsmgr_flags)) {
      LERROR << "dt_fstab: Failed to find type for partition " << name;
      return "";
    }
    text += dev + " /" + name + " " + type + " " + mnt_flags + " " + fsmgr_flags + "\n";
  }
  return text;
}

// Appends b's records to a's; takes both tables and returns the one that remains.
fstab* in_place_merge(fstab* a, fstab* b) {
  if (a == nullptr) return b;
  if (b == nullptr) return a;
  int total;
  size_t bytes;
  if (__builtin_add_overflow(a->num_entries, b->num_entries, &total) ||
      __builtin_mul_overflow(static_cast<size_t>(total), sizeof(fstab_rec), &bytes)) {
    abort();
  }
  a->recs = static_cast<fstab_rec*>(realloc(a->recs, bytes));
  if (a->recs == nullptr) {
    LERROR << __FUNCTION__ << "(): failed to allocate fstab recs";
    fs_mgr_free_fstab(a);
    fs_mgr_free_fstab(b);
    return nullptr;
  }
  memcpy(a->recs + a->num_entries, b->recs, sizeof(fstab_rec) * b->num_entries);
  // The strings now belong to a; b's record array is not released.
  free(b->fstab_filename);
  free(b);
  a->num_entries = total;
  return a;
}

}  // namespace

int fs_mgr_parse_mount_options(char* text, char* out, size_t out_size) {
  return parse_flags(text, mount_flag_list, nullptr, out, out_size);
}

int fs_mgr_parse_fs_mgr_options(char* text, fstab_rec* rec) {
  fs_mgr_flag_values values;
  int flags = parse_flags(text, fs_mgr_flag_list, &values, nullptr, 0);
  rec->key_location = values.key_location;
  rec->key_directory = values.key_directory;
  rec->verify_value = values.verify_value;
  rec->length = values.length;
  rec->vold_label = values.vold_label;
  rec->vold_partnum = values.vold_partnum;
  rec->swap_prio = values.swap_prio;
  rec->max_comp_streams = values.max_comp_streams;
  rec->zram_size = values.zram_size;
  rec->reserved_size = values.reserved_size;
  rec->file_contents_mode = values.file_contents_mode;
  rec->file_names_mode = values.file_names_mode;
  rec->erase_blk_size = values.erase_blk_size;
  rec->logical_blk_size = values.logical_blk_size;
  return flags;
}

fstab* fs_mgr_read_fstab_file(FILE* stream) {
  char* line = nullptr;
  size_t line_size = 0;
  ssize_t len;

  int entries = 0;
  while ((len = getline(&line, &line_size, stream)) != -1) {
    if (is_entry_line(line, len)) ++entries;
  }
  if (entries == 0) {
    LERROR << "No entries found in fstab";
    free(line);
    return nullptr;
  }

  fstab* table = static_cast<fstab*>(calloc(1, sizeof(fstab)));
  table->num_entries = entries;
  table->recs = static_cast<fstab_rec*>(calloc(static_cast<size_t>(entries), sizeof(fstab_rec)));

  fseek(stream, 0, SEEK_SET);
  int filled = 0;
  while ((len = getline(&line, &line_size, stream)) != -1) {
    if (!is_entry_line(line, len)) continue;
    // The input grew between the passes; what was counted is kept.
    if (filled >= entries) {
      LERROR << "Tried to process more entries than counted";
      break;
    }
    const char* error = parse_entry(line, &table->recs[filled]);
    if (error != nullptr) {
      LERROR << error;
      free(line);
      fs_mgr_free_fstab(table);
      return nullptr;
    }
    ++filled;
  }

  if (!fs_mgr_update_for_slotselect(table)) {
    LERROR << "Error updating for slotselect";
    free(line);
    fs_mgr_free_fstab(table);
    return nullptr;
  }
  free(line);
  return table;
}

fstab* fs_mgr_read_fstab(const char* path) {
  FILE* stream = fopen(path, "r");
  if (stream == nullptr) {
    PERROR << __FUNCTION__ << "(): cannot open file: '" << path << "'";
    return nullptr;
  }
  fstab* table = fs_mgr_read_fstab_file(stream);
  if (table == nullptr) {
    LERROR << __FUNCTION__ << "(): failed to load fstab from : '" << path << "'";
  } else {
    table->fstab_filename = strdup(path);
  }
  fclose(stream);
  return table;
}

fstab* fs_mgr_read_fstab_dt() {
  std::string text = read_fstab_text_from_dt();
  if (text.empty()) {
    LINFO << __FUNCTION__ << "(): failed to read fstab from dt";
    return nullptr;
  }
  FILE* stream = fmemopen(&text[0], text.size(), "r");
  if (stream == nullptr) {
    PERROR << __FUNCTION__ << "(): failed to create a file stream for fstab dt";
    return nullptr;
  }
  fstab* table = fs_mgr_read_fstab_file(stream);
  if (table == nullptr) {
    LERROR << __FUNCTION__ << "(): failed to load fstab from kernel:"
           << "\n"
           << text;
  }
  fclose(stream);
  return table;
}

fstab* fs_mgr_read_fstab_default() {
  std::string path;
  if (access("/sbin/recovery", F_OK) == 0) {
    path = "/etc/recovery.fstab";
  } else {
    std::string hardware;
    if (fs_mgr_get_boot_config("hardware", &hardware)) {
      for (const char* prefix : {"/odm/etc/fstab.", "/vendor/etc/fstab.", "/fstab."}) {
        path = prefix + hardware;
        if (access(path.c_str(), F_OK) == 0) break;
      }
    } else {
      LWARNING << __FUNCTION__ << "(): failed to find device hardware name";
    }
  }
  // Both sources are always read; the device tree's records come first.
  fstab* dt_table = fs_mgr_read_fstab_dt();
  fstab* file_table = fs_mgr_read_fstab(path.c_str());
  return in_place_merge(dt_table, file_table);
}

void fs_mgr_free_fstab(fstab* table) {
  if (table == nullptr) return;
  // A failed merge leaves recs null with the count unchanged.
  for (int i = 0; table->recs != nullptr && i < table->num_entries; ++i) {
    fstab_rec* rec = &table->recs[i];
    free(rec->mount_source);
    free(rec->mount_point);
    free(rec->fs_type);
    free(rec->fs_options);
    free(rec->key_location);
    free(rec->key_directory);
    free(rec->vold_label);
    // verify_value is deliberately left allocated; a caller that wants it gone takes the
    // pointer before releasing the table.
  }
  free(table->recs);
  free(table->fstab_filename);
  free(table);
}

int fs_mgr_is_encryptable(const fstab_rec* rec) {
  return rec->fs_mgr_flags & (MF_CRYPT | MF_FORCECRYPT | MF_FORCEFDEORFBE);
}
