// The mount table text parser on in-memory streams, and the block device lookup on a parsed
// table. Log lines are caught by an in-memory liblog sink as "<letter> <message>".
#include <android-base/logging.h>
#include <android/log.h>
#include <errno.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <string>
#include <vector>

#include "fs_mgr/fs_mgr_boot_config.h"
#include "fs_mgr/fs_mgr_fstab.h"
#include "ramdump/block_device.h"

namespace {

std::string captured;

void capture_log(const __android_logger_data* data, const char* message) {
  captured += std::string(1, "??VDIWEF"[data->priority & 7]) + " " + message + "\n";
}

void stderr_log(const __android_logger_data*, const char* message) {
  fprintf(stderr, "%s\n", message);
}

class Fstab : public testing::Test {
 protected:
  void SetUp() override {
    __android_log_set_logger(capture_log);
    android::base::SetMinimumLogSeverity(android::base::INFO);
    captured.clear();
  }
};

fstab* parse(std::string text) {
  FILE* stream = fmemopen(&text[0], text.size(), "r");
  fstab* table = fs_mgr_read_fstab_file(stream);
  fclose(stream);
  return table;
}

// The table releases everything but verify_value (released here, which would be a double
// free if the table had done it).
void release(fstab* table) {
  std::vector<char*> verify;
  for (int i = 0; table != nullptr && i < table->num_entries; ++i) {
    verify.push_back(table->recs[i].verify_value);
  }
  fs_mgr_free_fstab(table);
  for (char* v : verify) free(v);
}

// The record's fields, those at their defaults left out.
std::string describe(const fstab_rec& r) {
  char buf[64];
  snprintf(buf, sizeof(buf), "mf=0x%lx fmf=0x%x", r.mount_flags, r.fs_mgr_flags);
  std::string s = buf;
  auto str = [&](const char* name, const char* v) {
    if (v != nullptr) s += std::string(" ") + name + "=" + v;
  };
  auto num = [&](const char* name, long long v, long long def) {
    if (v != def) s += std::string(" ") + name + "=" + std::to_string(v);
  };
  str("opts", r.fs_options);
  str("key", r.key_location);
  str("keydir", r.key_directory);
  str("verify", r.verify_value);
  num("len", r.length, 0);
  str("label", r.vold_label);
  num("part", r.vold_partnum, -1);
  num("prio", r.swap_prio, -1);
  num("streams", r.max_comp_streams, 0);
  num("zram", r.zram_size, 0);
  if (r.reserved_size != 0) s += " reserved=" + std::to_string(r.reserved_size);
  num("fc", r.file_contents_mode, 0);
  num("fn", r.file_names_mode, 0);
  num("erase", r.erase_blk_size, 0);
  num("logical", r.logical_blk_size, 0);
  return s;
}

std::string describe(const fstab* t) {
  if (t == nullptr) return "null";
  std::string s;
  for (int i = 0; i < t->num_entries; ++i) {
    const fstab_rec& r = t->recs[i];
    s += std::string(r.mount_source ? r.mount_source : "-") + " " +
         (r.mount_point ? r.mount_point : "-") + " " + (r.fs_type ? r.fs_type : "-") + " " +
         describe(r) + "\n";
  }
  return s;
}

TEST_F(Fstab, OptionColumns) {
  const uint64_t half_ram = static_cast<uint64_t>(sysconf(_SC_PHYS_PAGES)) * 50 / 100 *
                            static_cast<uint64_t>(sysconf(_SC_PAGESIZE));
  std::string many;
  for (int i = 0; i < 300; ++i) many += "abcd,";
  struct {
    std::string col4, col5, want, log = "";
  } cases[] = {
      {"noatime,discard,data=ordered", "wait,check", "mf=0x400 fmf=0x3 opts=discard,data=ordered"},
      {"ro,rootcontext=x", "defaults", "mf=0x1 fmf=0x0"},
      {"nosuid,nodev,noexec,nodiratime,rw,remount,bind,rec,unbindable,private,slave,shared", "wait",
       "mf=0x1e582e fmf=0x1"},
      {",,a,,b,", "wait,,check,checkpoint", "mf=0x0 fmf=0x3 opts=a,b"},
      {many, "wait", "mf=0x0 fmf=0x1 opts=" + many.substr(0, 1022)},
      {std::string(5000, 'x'), "wait", "mf=0x0 fmf=0x1 opts=" + std::string(1022, 'x')},
      {"defaults", "verifyatboot", "mf=0x0 fmf=0x80000"},
      {"defaults", "verify=/dev/x", "mf=0x0 fmf=0x200 verify=/dev/x"},
      {"defaults", "verify", "mf=0x0 fmf=0x200"},
      {"defaults", "voldmanaged=sdcard1:auto", "mf=0x0 fmf=0x10 label=sdcard1"},
      {"defaults", "voldmanaged=usb:0x3", "mf=0x0 fmf=0x10 label=usb part=3"},
      {"defaults", "voldmanaged=usb", "mf=0x0 fmf=0x10",
       "E [libfs_mgr]Warning: voldmanaged= flag malformed\n"},
      {"defaults", "fileencryption=ice", "mf=0x0 fmf=0x2000 fc=2 fn=3"},
      {"defaults", "fileencryption=aes-256-xts:aes-256-heh", "mf=0x0 fmf=0x2000 fc=1 fn=4"},
      {"defaults", "fileencryption=foo", "mf=0x0 fmf=0x2000 fn=3",
       "E [libfs_mgr]Unknown file contents encryption mode: foo\n"},
      {"defaults", "fileencryption=software:ice", "mf=0x0 fmf=0x2000 fc=1",
       "E [libfs_mgr]Unknown file names encryption mode: ice\n"},
      {"defaults", "forcefdeorfbe=footer", "mf=0x0 fmf=0x10000 key=footer fc=1 fn=3"},
      {"defaults", "encryptable=a,forceencrypt=b,keydirectory=/k",
       "mf=0x0 fmf=0x4000404 key=b keydir=/k"},
      {"defaults", "length=-0x10,swapprio=010,max_comp_streams=4294967298",
       "mf=0x0 fmf=0x1000a0 len=-16 prio=8 streams=2"},
      {"defaults", "nonremovable,recoveryonly,avb,noemulatedsd,notrim,formattable",
       "mf=0x0 fmf=0x2005848"},
      {"defaults", "nofail,latemount,quota,bogus", "mf=0x0 fmf=0x460000",
       "E [libfs_mgr]Warning: unknown flag bogus\n"},
      {"defaults", "reservedsize=128M", "mf=0x0 fmf=0x200000 reserved=134217728"},
      {"defaults", "reservedsize=17179869183G,reservedsize=3k",
       "mf=0x0 fmf=0x200000 reserved=3072"},
      {"defaults", "reservedsize=0x10", "mf=0x0 fmf=0x200000"},
      {"defaults", "reservedsize=7x", "mf=0x0 fmf=0x200000 reserved=7"},
      {"defaults", "eraseblk=8192,logicalblk=0x1000",
       "mf=0x0 fmf=0x1800000 erase=8192 logical=4096"},
      {"defaults", "eraseblk=1000,logicalblk=6144", "mf=0x0 fmf=0x1800000"},
      {"defaults", "eraseblk=2048", "mf=0x0 fmf=0x800000"},
      {"defaults", "zramsize=0x1000", "mf=0x0 fmf=0x100 zram=4096"},
      {"defaults", "zramsize=4294967297", "mf=0x0 fmf=0x100 zram=1"},
      {"defaults", "zramsize=50%",
       "mf=0x0 fmf=0x100 zram=" + std::to_string(static_cast<uint32_t>(half_ram))},
  };
  for (const auto& c : cases) {
    captured.clear();
    fstab* t = parse("/dev/a /data ext4 " + c.col4 + " " + c.col5 + "\n");
    EXPECT_EQ(describe(t), "/dev/a /data ext4 " + c.want + "\n") << c.col4 << " " << c.col5;
    EXPECT_EQ(captured, c.log) << c.col5;
    release(t);
  }
}

TEST_F(Fstab, WholeFiles) {
  struct {
    std::string text, want, log = "";
  } cases[] = {
      {"", "null", "E [libfs_mgr]No entries found in fstab\n"},
      {"# only\n\n \t\r\n#/a /b c d e\n", "null", "E [libfs_mgr]No entries found in fstab\n"},
      {" \t/a#x /b  ext4\tro wait #sixth\n# c\n/c /d vfat rw defaults",
       "/a#x /b ext4 mf=0x1 fmf=0x1\n/c /d vfat mf=0x0 fmf=0x0\n"},
      {"/a /b ext4 ro wait\r\n/c /d ext4 rw encryptable=footer\r\n",
       "/a /b ext4 mf=0x1 fmf=0x1\n/c /d ext4 mf=0x0 fmf=0x4 key=footer\r\n"},
      {"/a /b ext4 ro wait\n/a /b ext4 ro\n", "null",
       "E [libfs_mgr]Error parsing fs_mgr_options\n"},
      {"/a /b ext4\n", "null", "E [libfs_mgr]Error parsing mount_flags\n"},
      {"/a /b\n", "null", "E [libfs_mgr]Error parsing fs_type\n"},
      {"/a\n", "null", "E [libfs_mgr]Error parsing mount_point\n"},
      {"\r/a /b ext4 ro wait\n", "\r/a /b ext4 mf=0x1 fmf=0x1\n"},
      {std::string("/a /b e\0x ro wait\n", 18), "null", "E [libfs_mgr]Error parsing mount_flags\n"},
      {"/a /b ext4 ro wait,slotselect\n/c /d e ro wait\n", "null",
       "E [libfs_mgr]Error updating for slotselect\n"},
  };
  // Without a slot suffix in the boot settings a slotselect record cannot be resolved.
  std::string suffix = fs_mgr_get_slot_suffix();
  for (const auto& c : cases) {
    if (!suffix.empty() && c.text.find("slotselect") != std::string::npos) continue;
    captured.clear();
    fstab* t = parse(c.text);
    EXPECT_EQ(describe(t), c.want) << c.text;
    EXPECT_EQ(captured, c.log) << c.text;
    if (t != nullptr) {
      EXPECT_EQ(t->fstab_filename, nullptr);
    }
    release(t);
  }
}

// A stream whose content changes once it is rewound, as a file rewritten between the passes.
struct two_faced {
  std::string first, second;
  std::string* now = nullptr;
  size_t pos = 0;
};

FILE* open_two_faced(two_faced* s) {
  cookie_io_functions_t io = {};
  io.read = [](void* c, char* buf, size_t size) -> ssize_t {
    two_faced* s = static_cast<two_faced*>(c);
    size_t n = std::min(size, s->now->size() - s->pos);
    memcpy(buf, s->now->data() + s->pos, n);
    s->pos += n;
    return static_cast<ssize_t>(n);
  };
  io.seek = [](void* c, off64_t* offset, int) {
    two_faced* s = static_cast<two_faced*>(c);
    s->now = &s->second;
    s->pos = 0;
    *offset = 0;
    return 0;
  };
  s->now = &s->first;
  s->pos = 0;
  return fopencookie(s, "r", io);
}

TEST_F(Fstab, InputChangingBetweenPassesAndBlockDeviceLookup) {
  two_faced grew = {"/a /b e ro wait\n", "/a /b e ro wait\n/c /d e ro wait\n"};
  FILE* stream = open_two_faced(&grew);
  fstab* t = fs_mgr_read_fstab_file(stream);
  fclose(stream);
  EXPECT_EQ(describe(t), "/a /b e mf=0x1 fmf=0x1\n");
  EXPECT_EQ(captured, "E [libfs_mgr]Tried to process more entries than counted\n");
  release(t);

  two_faced shrank = {"x\nx\nx\n", "/dev/data /data e rw wait,forceencrypt=footer\n"};
  stream = open_two_faced(&shrank);
  t = fs_mgr_read_fstab_file(stream);
  fclose(stream);
  ASSERT_EQ(describe(t),
            "/dev/data /data e mf=0x0 fmf=0x401 key=footer\n- - - mf=0x0 fmf=0x0 part=0 prio=0\n"
            "- - - mf=0x0 fmf=0x0 part=0 prio=0\n");
  EXPECT_EQ(fs_mgr_is_encryptable(&t->recs[0]), 0x400);
  int encryptable = -7, encrypted = -7;
  // The zero-filled records have no mount point and are passed over.
  EXPECT_EQ(find_block_device("/elsewhere", t, &encryptable, &encrypted), nullptr);
  EXPECT_EQ(encryptable, -7);
  EXPECT_STREQ(find_block_device("/data/x", t, &encryptable, &encrypted), "/dev/data");
  EXPECT_EQ(encryptable, 1);
  release(t);

  t = parse(
      "/dev/root / ext4 ro wait\n/dev/data /data ext4 rw wait\n/dev/data2 /data ext4 rw wait\n"
      "/dev/mnt /mnt/ ext4 rw wait\n/dev/fw /vendor/fw e ro wait\n/dev/vendor /vendor e ro wait\n");
  struct {
    const char* path;
    const char* want;
  } lookups[] = {
      {"/data/vendor/ramdump/RAMDUMP_RESERVED", "/dev/data"},
      {"/data", "/dev/data"},
      {"/database/x", nullptr},
      {"/mnt/x", nullptr},
      {"/", "/dev/root"},
      {"/system/x", nullptr},
      {"/vendor/fw/x", "/dev/fw"},
      {"/vendor/x", "/dev/vendor"},
  };
  for (const auto& l : lookups) {
    encryptable = encrypted = -7;
    const char* got = find_block_device(l.path, t, &encryptable, &encrypted);
    EXPECT_STREQ(got, l.want) << l.path;
    EXPECT_EQ(encryptable, got != nullptr ? 0 : -7) << l.path;
    EXPECT_EQ(encrypted, got != nullptr ? 0 : -7) << l.path;
  }
  release(t);
  fstab empty = {0, nullptr, nullptr};
  EXPECT_EQ(find_block_device("/data", &empty, &encryptable, &encrypted), nullptr);
}

TEST_F(Fstab, OpenFailureKeepsErrno) {
  errno = 0;
  EXPECT_EQ(fs_mgr_read_fstab("/nonexistent/fstab.x"), nullptr);
  EXPECT_EQ(errno, ENOENT);
  EXPECT_EQ(captured,
            "E [libfs_mgr]fs_mgr_read_fstab(): cannot open file: '/nonexistent/fstab.x': No such "
            "file or directory\n");
}

TEST(FstabDeath, OverflowAndNullOutputAbort) {
  EXPECT_DEATH(parse("/a /b e ro reservedsize=17179869184G\n"), "");
  EXPECT_DEATH(parse("/a /b e ro reservedsize=17592186044416m\n"), "");
  EXPECT_DEATH(
      {
        __android_log_set_logger(stderr_log);
        fs_mgr_get_boot_config("hardware", nullptr);
      },
      "(^|\n)Check failed: out_val != nullptr in libfs_mgr \n");
}

}  // namespace
