// The mount table text parser on in-memory streams, and the block device lookup on a parsed
// table. Log records are caught in memory as "<letter> <message>".
#include <android-base/logging.h>
#include <android/log.h>
#include <errno.h>
#include <gtest/gtest.h>
#include <string.h>
#include <unistd.h>

#include <algorithm>
#include <fstream>
#include <functional>
#include <string>
#include <vector>

#include "fs_mgr/fs_mgr_boot_config.h"
#include "fs_mgr/fs_mgr_fstab.h"
#include "ramdump/block_device.h"

// Heap blocks in use, counted by the program's own allocator entry points, which glibc's
// functions call too. Sanitizer builds keep theirs and check leaks with it.
static long live_blocks;
#if !defined(__SANITIZE_ADDRESS__)
extern "C" {
void* __libc_malloc(size_t);
void* __libc_calloc(size_t, size_t);
void* __libc_realloc(void*, size_t);
void __libc_free(void*);
static void* counted(void* p) { return live_blocks += p != nullptr, p; }
void* malloc(size_t n) { return counted(__libc_malloc(n)); }
void* calloc(size_t n, size_t size) { return counted(__libc_calloc(n, size)); }
void free(void* p) { live_blocks -= p != nullptr, __libc_free(p); }
void* realloc(void* old, size_t n) {
  void* p = __libc_realloc(old, n);
  live_blocks += (p != nullptr) - (old != nullptr && (p != nullptr || n == 0));
  return p;
}
}
#endif

namespace {

std::string captured;

void capture_log(const __android_logger_data* data, const char* message) {
  captured += std::string(1, "??VDIWEF"[data->priority & 7]) + " " + message + "\n";
}

class Fstab : public testing::Test {
 protected:
  void SetUp() override {
    __android_log_set_logger(capture_log);
    android::base::SetMinimumLogSeverity(android::base::INFO);
    captured.clear();
    captured.reserve(1 << 16);  // so that logging allocates nothing that outlives a message
  }
};

// Parses the text from a stream that shows `second` instead once the parser rewinds it for its
// second pass, as a file rewritten in between, when that is given.
fstab* parse(const std::string& text, const std::string& second = "") {
  struct shown {
    const std::string* now;
    std::string second;
    size_t pos;
  } s = {&text, second.empty() ? text : second, 0};
  cookie_io_functions_t io = {};
  io.read = [](void* c, char* buf, size_t size) -> ssize_t {
    shown* s = static_cast<shown*>(c);
    size_t n = std::min(size, s->now->size() - s->pos);
    memcpy(buf, s->now->data() + s->pos, n);
    s->pos += n;
    return static_cast<ssize_t>(n);
  };
  io.seek = [](void* c, off64_t* offset, int) {
    shown* s = static_cast<shown*>(c);
    s->now = &s->second;
    s->pos = *offset = 0;
    return 0;
  };
  FILE* stream = fopencookie(&s, "r", io);
  fstab* table = fs_mgr_read_fstab_file(stream);
  fclose(stream);
  return table;
}

// The table's release leaves verify_value to its owner.
void release(fstab* table) {
  for (int i = 0; table != nullptr && i < table->num_entries; ++i)
    free(table->recs[i].verify_value);
  fs_mgr_free_fstab(table);
}

// Every record as "source point type" and its other fields, those at their defaults left out.
std::string describe(const fstab* t) {
  if (t == nullptr) return "null";
  std::string s;
  for (const fstab_rec* r = t->recs; r < t->recs + t->num_entries; ++r) {
    char flags[64];
    snprintf(flags, sizeof(flags), " mf=0x%lx fmf=0x%x", r->mount_flags, r->fs_mgr_flags);
    // The encryption bits themselves come back, not 1.
    if (fs_mgr_is_encryptable(r) != 0) {
      snprintf(flags + strlen(flags), sizeof(flags) - strlen(flags), " enc=0x%x",
               fs_mgr_is_encryptable(r));
    }
    s += std::string(r->mount_source ? r->mount_source : "-") + " " +
         (r->mount_point ? r->mount_point : "-") + " " + (r->fs_type ? r->fs_type : "-") + flags;
    const char* strings[] = {r->fs_options, r->key_location, r->key_directory, r->verify_value,
                             r->vold_label};
    const char* string_names[] = {" opts=", " key=", " keydir=", " verify=", " label="};
    for (int i = 0; i < 5; ++i) s += strings[i] ? string_names[i] + std::string(strings[i]) : "";
    const long long numbers[] = {r->length,           r->vold_partnum,
                                 r->swap_prio,        r->max_comp_streams,
                                 r->zram_size,        r->file_contents_mode,
                                 r->file_names_mode,  r->erase_blk_size,
                                 r->logical_blk_size, static_cast<long long>(r->reserved_size)};
    const char* number_names[] = {" len=", " part=", " prio=",  " streams=", " zram=",
                                  " fc=",  " fn=",   " erase=", " logical=", " reserved="};
    for (int i = 0; i < 10; ++i) {  // part and prio default to -1, the others to 0
      if (numbers[i] != (i == 1 || i == 2 ? -1 : 0))
        s += number_names[i] + std::to_string(numbers[i]);
    }
    s += "\n";
  }
  return s;
}

// Parses and describes the text (see parse and describe), and checks that parsing and releasing
// it leaves no heap block behind. That is counted on a second round, after the libraries'
// first-use allocations.
std::string parse_and_describe(const std::string& text, const std::string& second = "") {
  std::string got;
  got.reserve(1 << 14);
  for (int round = 0; round < 2; ++round) {
    captured.clear();
    const long before = live_blocks;
    fstab* table = parse(text, second);
    got.assign(describe(table));
    release(table);
    if (round == 1) {
      EXPECT_EQ(live_blocks, before) << "heap blocks left by " << text;
    }
  }
  return got;
}

TEST_F(Fstab, OptionColumns) {
  const uint64_t half_ram = static_cast<uint64_t>(sysconf(_SC_PHYS_PAGES)) * 50 / 100 *
                            static_cast<uint64_t>(sysconf(_SC_PAGESIZE));
  // Exactly 1022 characters before "yz": one more fits, then the last kept one is dropped.
  const std::string cut = std::string(1021, 'x') + ",yz";
  struct {
    std::string col4, col5, want, log = "";
  } cases[] = {
      {",noatime,,discard,data=ordered", "wait,,check,checkpoint",
       "mf=0x400 fmf=0x3 opts=discard,data=ordered"},
      // "rootcontext=x" is taken for "ro".
      {"nosuid,nodev,noexec,nodiratime,rw,remount,bind,rec,unbindable,private,slave,shared,"
       "rootcontext=x",
       "defaults", "mf=0x1e582f fmf=0x0"},
      {cut, "wait", "mf=0x0 fmf=0x1 opts=" + cut.substr(0, 1022)},
      {"defaults", "verify=/dev/x,verify", "mf=0x0 fmf=0x200 verify=/dev/x"},
      {"defaults", "voldmanaged=sdcard1:auto", "mf=0x0 fmf=0x10 label=sdcard1"},
      {"defaults", "voldmanaged=usb,voldmanaged=x:1,voldmanaged=usb:0x3",
       "mf=0x0 fmf=0x10 label=usb part=3", "E [libfs_mgr]Warning: voldmanaged= flag malformed\n"},
      {"defaults", "fileencryption=ice", "mf=0x0 fmf=0x2000 fc=2 fn=3"},
      {"defaults", "fileencryption=aes-256-xts:aes-256-heh", "mf=0x0 fmf=0x2000 fc=1 fn=4"},
      {"defaults", "fileencryption=:aes-256-heh", "mf=0x0 fmf=0x2000 fn=4",
       "E [libfs_mgr]Unknown file contents encryption mode: \n"},
      {"defaults", "fileencryption=software:ice", "mf=0x0 fmf=0x2000 fc=1",
       "E [libfs_mgr]Unknown file names encryption mode: ice\n"},
      {"defaults", "forcefdeorfbe=footer", "mf=0x0 fmf=0x10000 enc=0x10000 key=footer fc=1 fn=3"},
      {"defaults", "encryptable=a,forceencrypt=b,keydirectory=/k",
       "mf=0x0 fmf=0x4000404 enc=0x404 key=b keydir=/k"},
      {"defaults", "length=-0x10,swapprio=010,max_comp_streams=4294967298",
       "mf=0x0 fmf=0x1000a0 len=-16 prio=8 streams=2"},
      // "verifyatboot" must not be taken for "verify".
      {"defaults",
       "nonremovable,recoveryonly,avb,noemulatedsd,notrim,formattable,nofail,latemount,quota,"
       "verifyatboot,bogus",
       "mf=0x0 fmf=0x24e5848", "E [libfs_mgr]Warning: unknown flag bogus\n"},
      {"defaults", "reservedsize=128M", "mf=0x0 fmf=0x200000 reserved=134217728"},
      {"defaults", "reservedsize=17179869183G,reservedsize=3k",
       "mf=0x0 fmf=0x200000 reserved=3072"},
      {"defaults", "reservedsize=0x10", "mf=0x0 fmf=0x200000"},
      {"defaults", "reservedsize=7x", "mf=0x0 fmf=0x200000 reserved=7"},
      {"defaults", "eraseblk=2048,logicalblk=6144", "mf=0x0 fmf=0x1800000"},
      {"defaults", "eraseblk=8192,eraseblk=1000,logicalblk=0x1000,logicalblk=6144",
       "mf=0x0 fmf=0x1800000 erase=8192 logical=4096"},
      {"defaults", "zramsize=0x100000001", "mf=0x0 fmf=0x100 zram=1"},
      {"defaults", "zramsize=50%",
       "mf=0x0 fmf=0x100 zram=" + std::to_string(static_cast<uint32_t>(half_ram))},
  };
  for (const auto& c : cases) {
    EXPECT_EQ(parse_and_describe("/dev/a /data ext4 " + c.col4 + " " + c.col5 + "\n"),
              "/dev/a /data ext4 " + c.want + "\n")
        << c.col5;
    EXPECT_EQ(captured, c.log) << c.col5;
  }
}

TEST_F(Fstab, WholeFiles) {
  const std::string no_entries = "E [libfs_mgr]No entries found in fstab\n";
  struct {
    std::string text, want, log = "", second = "";  // second: what the second pass reads
  } cases[] = {
      {"# only\n\n \t\r\n#/a /b c d e\n", "null", no_entries},
      {" \t/a#x /b  ext4\tro wait #sixth\n# c\n/c /d vfat rw defaults",
       "/a#x /b ext4 mf=0x1 fmf=0x1\n/c /d vfat mf=0x0 fmf=0x0\n"},
      // A carriage return is part of a column: a trailing "wait" still matches by prefix, a value
      // keeps it.
      {"\r/a /b ext4 ro,x wait,encryptable=footer\r\n",
       "\r/a /b ext4 mf=0x1 fmf=0x5 enc=0x4 opts=x key=footer\r\n"},
      {"/a /b ext4 ro\n", "null", "E [libfs_mgr]Error parsing fs_mgr_options\n"},
      {"/a /b ext4 ro wait\n/a /b\n", "null", "E [libfs_mgr]Error parsing fs_type\n"},
      // A slot suffix comes from the boot settings, which a build host does not have.
      {"/a /b e ro slotselect\n", "null", "E [libfs_mgr]Error updating for slotselect\n"},
      {"/a /b e ro wait\n", "/a /b e mf=0x1 fmf=0x1\n",
       "E [libfs_mgr]Tried to process more entries than counted\n",
       "/a /b e ro wait\n/c /d e ro wait\n"},
      // Records counted but not found again stay zero-filled.
      {"x\nx\n",
       "/a /b e mf=0x0 fmf=0x400 enc=0x400 key=footer\n- - - mf=0x0 fmf=0x0 part=0 prio=0\n", "",
       "/a /b e rw forceencrypt=footer\n"},
  };
  for (const auto& c : cases) {
    EXPECT_EQ(parse_and_describe(c.text, c.second), c.want) << c.text;
    EXPECT_EQ(captured, c.log) << c.text;
  }
  // From a file, which the reader closes again.
  char path[] = "/tmp/fstab_parser_test.XXXXXX";
  close(mkstemp(path));
  std::ofstream(path) << "/a /b e ro wait\n";
  const long before = live_blocks;
  fstab* table = fs_mgr_read_fstab(path);
  ASSERT_NE(table, nullptr);
  EXPECT_STREQ(table->fstab_filename, path);
  release(table);
  EXPECT_EQ(live_blocks, before);
  unlink(path);
}

// The first record whose mount point holds the path wins, at a path component boundary;
// zero-filled records (see WholeFiles) are passed over.
TEST_F(Fstab, BlockDeviceLookup) {
  const std::string text =
      "/dev/root / ext4 ro wait\n/dev/data /data ext4 rw wait\n/dev/data2 /data ext4 rw wait\n"
      "/dev/mnt /mnt/ ext4 rw wait\n/dev/fw /vendor/fw e ro wait\n/dev/vendor /vendor e ro wait\n";
  fstab* t = parse(text + "x\nx\n", text);
  const std::pair<const char*, const char*> lookups[] = {
      {"/data/vendor/ramdump/RAMDUMP_RESERVED", "/dev/data"},
      {"/data", "/dev/data"},
      {"/database/x", nullptr},
      {"/mnt/x", nullptr},
      {"/", "/dev/root"},
      {"/system/x", nullptr},
      {"/vendor/fw/x", "/dev/fw"},
      {"/vendor/x", "/dev/vendor"},
  };
  int encryptable, encrypted;
  for (const auto& [path, want] : lookups) {
    EXPECT_STREQ(find_block_device(path, t, &encryptable, &encrypted), want) << path;
  }
  release(t);
  t = parse("/dev/data /data ext4 rw wait\n");
  EXPECT_STREQ(find_block_device("/data/x", t, &encryptable, &encrypted), "/dev/data");
  release(t);
  EXPECT_EQ(find_block_device("/data", nullptr, &encryptable, &encrypted), nullptr);
}

// Logging a failure leaves the caller's errno as the failure set it.
TEST_F(Fstab, OpenFailureKeepsErrno) {
  errno = 0;
  EXPECT_EQ(fs_mgr_read_fstab("/nonexistent/fstab.x"), nullptr);
  EXPECT_EQ(errno, ENOENT);
}

TEST(FstabDeath, OverflowAndNullOutputAbort) {
  EXPECT_DEATH(parse("/a /b e ro reservedsize=17179869184G\n"), "");
  EXPECT_DEATH(parse("/a /b e ro reservedsize=17592186044416m\n"), "");
  // Every boot setting lookup refuses a null output, whether it finds the setting or not.
  const std::function<void()> null_outputs[] = {
      [] { fs_mgr_get_boot_config("hardware", nullptr); },
      [] { fs_mgr_get_boot_config_from_kernel_cmdline("hardware", nullptr); },
      [] { fs_mgr_get_boot_config_from_cmdline_text("androidboot.x=1", "x", nullptr); },
  };
  for (const auto& lookup : null_outputs) {
    EXPECT_DEATH(
        {
          __android_log_set_logger([](const __android_logger_data*, const char* message) {
            fprintf(stderr, "%s\n", message);
          });
          lookup();
        },
        "(^|\n)Check failed: out_val != nullptr in libfs_mgr \n");
  }
}

}  // namespace
