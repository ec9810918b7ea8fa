// The mount table text parser on in-memory streams, and the block device lookup on a parsed
// table. Log records are caught in memory as "<letter> <message>".
#include <android-base/logging.h>
#include <android/log.h>
#include <gtest/gtest.h>
#include <inttypes.h>
#include <sys/mount.h>
#include <unistd.h>

#include <fstream>
#include <regex>
#include <string>

#include "fs_mgr/fs_mgr_boot_config.h"
#include "fs_mgr/fs_mgr_fstab.h"
#include "ramdump/block_device.h"

// Heap blocks in use, counted at the entry points that glibc's own functions call too (its realloc
// keeps the count). Sanitizer builds keep theirs and check leaks with it.
static long live_blocks;
#if !defined(__SANITIZE_ADDRESS__)
extern "C" {
void* __libc_malloc(size_t);
void* __libc_calloc(size_t, size_t);
void __libc_free(void*);
static void* counted(void* p) { return live_blocks += p != nullptr, p; }
void* malloc(size_t n) { return counted(__libc_malloc(n)); }
void* calloc(size_t n, size_t size) { return counted(__libc_calloc(n, size)); }
void free(void* p) { live_blocks -= p != nullptr, __libc_free(p); }
}
#endif

namespace {

// Log records as "<letter> <message>" lines; reserved so that logging allocates nothing that
// outlives a message.
std::string captured = [] {
  __android_log_set_logger([](const __android_logger_data* data, const char* message) {
    captured += std::string(1, "??VDIWEF"[data->priority & 7]) + " " + message + "\n";
  });
  android::base::SetMinimumLogSeverity(android::base::INFO);
  return std::string(1 << 16, ' ');
}();

// Parses text from a stream that reads `second` instead once the parser rewinds it, as a file
// rewritten between the two passes.
fstab* parse(const std::string& text, const std::string& second = "") {
  std::pair<std::string, std::string> texts{text, second.empty() ? text : second};
  cookie_io_functions_t io = {};
  io.read = [](void* c, char* buf, size_t size) -> ssize_t {
    std::string& now = static_cast<decltype(texts)*>(c)->first;
    const size_t n = now.copy(buf, size);
    return now.erase(0, n), static_cast<ssize_t>(n);
  };
  io.seek = [](void* c, off64_t* offset, int) {
    static_cast<decltype(texts)*>(c)->first = static_cast<decltype(texts)*>(c)->second;
    return static_cast<int>(*offset = 0);
  };
  FILE* stream = fopencookie(&texts, "r", io);
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

// Every record as "source point type" and its other fields, those at their defaults left out (part
// and prio default to -1); "enc" is what fs_mgr_is_encryptable returns.
std::string describe(const fstab* t) {
  if (t == nullptr) return "null";
  std::string s;
  char buf[4096];
  for (const fstab_rec* r = t->recs; r < t->recs + t->num_entries; ++r) {
    const auto str = [](const char* p, const char* none = "(none)") { return p ? p : none; };
    snprintf(buf, sizeof(buf),
             "%s %s %s mf=0x%lx fmf=0x%x enc=0x%x len=%lld part=%d prio=%d streams=%d zram=%u "
             "fc=%u fn=%u erase=%u logical=%u reserved=%" PRIu64
             " opts=%s key=%s keydir=%s verify=%s label=%s\n",
             str(r->mount_source, "-"), str(r->mount_point, "-"), str(r->fs_type, "-"),
             r->mount_flags, r->fs_mgr_flags, fs_mgr_is_encryptable(r), r->length, r->vold_partnum,
             r->swap_prio, r->max_comp_streams, r->zram_size, r->file_contents_mode,
             r->file_names_mode, r->erase_blk_size, r->logical_blk_size, r->reserved_size,
             str(r->fs_options), str(r->key_location), str(r->key_directory), str(r->verify_value),
             str(r->vold_label));
    s += std::regex_replace(
        buf, std::regex(" (part|prio)=-1\\b| (?!part|prio)[a-z]+=((0x)?0\\b|\\(none\\))"), "");
  }
  return s;
}

TEST(Fstab, Texts) {
  const uint64_t half_ram = static_cast<uint64_t>(sysconf(_SC_PHYS_PAGES)) * 50 / 100 *
                            static_cast<uint64_t>(sysconf(_SC_PAGESIZE));
  // Exactly 1022 characters before "yz": one more fits, then the last kept one is dropped.
  const std::string cut = std::string(1021, 'x') + ",yz", e = "E [libfs_mgr]";
  struct {
    std::string text, want, log = "", second = "";  // second: what the second pass reads
  } cases[] = {
      {"/a /b e ,noatime,,discard,data=ordered wait,,check,checkpoint\n",
       "/a /b e mf=0x400 fmf=0x3 opts=discard,data=ordered\n"},
      // "rootcontext=x" is taken for "ro".
      {"/a /b e nosuid,nodev,noexec,nodiratime,rw,remount,bind,rec,unbindable,private,slave,"
       "shared,rootcontext=x defaults\n",
       "/a /b e mf=0x1e582f\n"},
      {"/a /b e " + cut + " wait\n", "/a /b e fmf=0x1 opts=" + cut.substr(0, 1022) + "\n"},
      {"/a /b e defaults verify=/dev/x,verify,voldmanaged=sdcard1:auto,fileencryption=ice,"
       "reservedsize=0x10,eraseblk=2048,logicalblk=6144\n",
       "/a /b e fmf=0x1a02210 fc=2 fn=3 verify=/dev/x label=sdcard1\n"},
      {"/a /b e rw voldmanaged=usb,voldmanaged=x:1,voldmanaged=usb:0x3,"
       "fileencryption=:aes-256-heh,reservedsize=7x,zramsize=0x100000001\n",
       "/a /b e fmf=0x202110 part=3 zram=1 fn=4 reserved=7 label=usb\n",
       e + "Warning: voldmanaged= flag malformed\n" + e +
           "Unknown file contents encryption mode: \n"},
      {"/a /b e rw fileencryption=software:ice,reservedsize=128M,length=-0x10,swapprio=010,"
       "max_comp_streams=4294967298\n",
       "/a /b e fmf=0x3020a0 len=-16 prio=8 streams=2 fc=1 reserved=134217728\n",
       e + "Unknown file names encryption mode: ice\n"},
      {"/a /b e rw fileencryption=aes-256-xts:aes-256-heh,reservedsize=17179869183G,"
       "reservedsize=3k,eraseblk=8192,eraseblk=1000,logicalblk=0x1000,logicalblk=6144,zramsize=50%",
       "/a /b e fmf=0x1a02100 zram=" + std::to_string(static_cast<uint32_t>(half_ram)) +
           " fc=1 fn=4 erase=8192 logical=4096 reserved=3072\n"},
      {"/a /b e rw encryptable=a,forceencrypt=b,keydirectory=/k,forcefdeorfbe=footer\n",
       "/a /b e fmf=0x4010404 enc=0x10404 fc=1 fn=3 key=footer keydir=/k\n"},
      // "verifyatboot" must not be taken for "verify".
      {"/a /b e rw nonremovable,recoveryonly,avb,noemulatedsd,notrim,formattable,nofail,latemount,"
       "quota,verifyatboot,bogus\n",
       "/a /b e fmf=0x24e5848\n", e + "Warning: unknown flag bogus\n"},
      {"# only\n\n \t\r\n#/a /b c d e\n", "null", e + "No entries found in fstab\n"},
      {" \t/a#x /b  ext4\tro wait #sixth\n# c\n/c /d vfat rw defaults",
       "/a#x /b ext4 mf=0x1 fmf=0x1\n/c /d vfat\n"},
      // A carriage return is part of a column: "wait" still matches by prefix, a value keeps it.
      {"\r/a /b ext4 ro,x wait,encryptable=footer\r\n",
       "\r/a /b ext4 mf=0x1 fmf=0x5 enc=0x4 opts=x key=footer\r\n"},
      {"/a /b ext4 ro\n", "null", e + "Error parsing fs_mgr_options\n"},
      {"/a /b ext4 ro wait\n/a /b\n", "null", e + "Error parsing fs_type\n"},
      // A slot suffix comes from the boot settings, which a build host does not have.
      {"/a /b e ro slotselect\n", "null", e + "Error updating for slotselect\n"},
      {"/a /b e ro wait\n", "/a /b e mf=0x1 fmf=0x1\n",
       e + "Tried to process more entries than counted\n", "/a /b e ro wait\n/c /d e ro wait\n"},
      // Records counted but not found again stay zero-filled.
      {"x\nx\n", "/a /b e fmf=0x400 enc=0x400 key=footer\n- - - part=0 prio=0\n", "",
       "/a /b e rw forceencrypt=footer\n"},
  };
  // A first round makes the libraries' first-use allocations; then no case may leave a heap block.
  for (const auto& c : cases) release(parse(c.text, c.second));
  for (const auto& c : cases) {
    captured.clear();
    const long before = live_blocks;
    fstab* table = parse(c.text, c.second);
    EXPECT_EQ(describe(table), c.want) << c.text;
    release(table);
    EXPECT_EQ(live_blocks, before) << "heap blocks left by " << c.text;
    EXPECT_EQ(captured, c.log) << c.text;
  }
  // The collected unknown options replace what the buffer held, within its size.
  for (const auto& [size, want] : {std::pair<size_t, const char*>{6, "x"}, {1, ""}, {0, "stale"}}) {
    char text[] = "ro,x", out[] = "stale";
    EXPECT_EQ(fs_mgr_parse_mount_options(text, out, size), MS_RDONLY);
    EXPECT_STREQ(out, want) << size;
  }
  // Only the records counted are looked at for a slot.
  fstab_rec recs[2] = {};
  recs[1].fs_mgr_flags = MF_SLOTSELECT;
  fstab one = {1, recs, nullptr};
  EXPECT_TRUE(fs_mgr_update_for_slotselect(&one));
}

// The first record whose mount point holds the path wins, at a path component boundary;
// zero-filled records are passed over. A table read from a file leaves no heap block behind.
TEST(Fstab, FilesAndBlockDeviceLookup) {
  const std::string text =
      "/dev/root / ext4 ro wait\n/dev/data /data ext4 rw wait\n/dev/data2 /data ext4 rw wait\n"
      "/dev/mnt /mnt/ ext4 rw wait\n/dev/fw /vendor/fw e ro wait\n/dev/vendor /vendor e ro wait\n";
  fstab* t = parse(text + "x\nx\n", text);
  const char* lookups[] = {
      "/data/vendor/x", "/dev/data", "/data",     "/dev/data",  "/database/x", nullptr,
      "/mnt/x",         nullptr,     "/",         "/dev/root",  "/system/x",   nullptr,
      "/vendor/fw/x",   "/dev/fw",   "/vendor/x", "/dev/vendor"};
  int encryptable, encrypted;
  for (size_t i = 0; i < std::size(lookups); i += 2) {
    EXPECT_STREQ(find_block_device(lookups[i], t, &encryptable, &encrypted), lookups[i + 1]);
  }
  release(t);
  EXPECT_EQ(find_block_device("/data", nullptr, &encryptable, &encrypted), nullptr);
  char path[] = "/tmp/fstab_parser_test.XXXXXX";
  close(mkstemp(path));
  std::ofstream(path) << "/dev/data /data ext4 rw wait\n";
  const long before = live_blocks;
  t = fs_mgr_read_fstab(path);
  EXPECT_STREQ(find_block_device("/data/x", t, &encryptable, &encrypted), "/dev/data");
  release(t);
  EXPECT_EQ(live_blocks, before);
  unlink(path);
}

TEST(FstabDeath, OverflowAndNullOutputAbort) {
  EXPECT_DEATH(parse("/a /b e ro reservedsize=17179869184G\n"), "");
  EXPECT_DEATH(parse("/a /b e ro reservedsize=17592186044416m\n"), "");
  // Every boot setting lookup refuses a null output, whether it finds the setting or not.
  const std::string check = "(^|\n)Check failed: out_val != nullptr in libfs_mgr \n";
  __android_log_set_logger(
      [](const __android_logger_data*, const char* message) { fprintf(stderr, "%s\n", message); });
  EXPECT_DEATH(fs_mgr_get_boot_config("hardware", nullptr), check);
  EXPECT_DEATH(fs_mgr_get_boot_config_from_kernel_cmdline("hardware", nullptr), check);
  EXPECT_DEATH(fs_mgr_get_boot_config_from_cmdline_text("androidboot.x=1", "x", nullptr), check);
}

}  // namespace
