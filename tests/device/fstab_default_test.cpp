// The default mount table inside the fake device root: which table file is chosen, the
// device-tree table merged in front of it, slot suffixes, boot settings from the kernel command
// line and the device tree, and the encryption state reported with a block device.
#include <dirent.h>
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "fs_mgr/fs_mgr_boot_config.h"
#include "platform/log.h"
#include "ramdump/block_device.h"
#include "tests/harness/fake_device.h"

namespace {

const std::string kNoDt =
    "I fstab_dump: [libfs_mgr]fs_mgr_read_fstab_dt(): failed to read fstab from dt\n";

// The value of one "name=value" line of fstab_dump's output.
std::string field(const std::string& out, const std::string& name) {
  const std::string text = "\n" + out, key = "\n" + name + "=";
  size_t at = text.find(key);
  if (at == std::string::npos) return "<none>";
  at += key.size();
  return text.substr(at, text.find('\n', at) - at);
}

// Runs fstab_dump --default on a fresh log: "<num_entries> <fstab_filename>" or "NULL TABLE".
std::string dump_default(FakeDevice& device, RunResult* result = nullptr) {
  device.clear_log();
  RunResult r = device.run({"--default"}, "fstab_dump");
  if (result != nullptr) *result = r;
  if (r.out == "NULL TABLE\n") return r.status == 1 ? "NULL TABLE" : "bad status";
  return field(r.out, "num_entries") + " " + field(r.out, "fstab_filename") +
         (r.status == 0 ? "" : " bad status");
}

bool log_has(const FakeDevice& device, const std::string& part) {
  return device.log().find(part) != std::string::npos;
}

std::string dt(const std::string& value) { return value + '\0'; }

TEST(DefaultFstab, TableFileChoice) {
  FakeDeviceConfig config;
  config.data_fstab_line =
      "/dev/block/bootdevice/by-name/userdata /data ext4 noatime,nosuid,q\"u\\o\xc3\xa9 "
      "wait,check,encryptable=footer\r\n";
  FakeDevice device(config);
  REQUIRE_DEVICE(device);
  RunResult r;
  EXPECT_EQ(dump_default(device, &r), "1 \"/vendor/etc/fstab.rbtest\"");
  EXPECT_EQ(r.out,
            "num_entries=1\nfstab_filename=\"/vendor/etc/fstab.rbtest\"\n"
            "rec[0].mount_source=\"/dev/block/bootdevice/by-name/userdata\"\n"
            "rec[0].mount_point=\"/data\"\nrec[0].fs_type=\"ext4\"\nrec[0].mount_flags=0x402\n"
            "rec[0].fs_options=\"q\\\"u\\\\o\\xc3\\xa9\"\nrec[0].fs_mgr_flags=0x7\n"
            "rec[0].key_location=\"footer\\x0d\"\nrec[0].key_directory=NULL\n"
            "rec[0].verify_value=NULL\nrec[0].length=0\nrec[0].vold_label=NULL\n"
            "rec[0].vold_partnum=-1\nrec[0].swap_prio=-1\nrec[0].max_comp_streams=0\n"
            "rec[0].zram_size=0\nrec[0].reserved_size=0\nrec[0].file_contents_mode=0\n"
            "rec[0].file_names_mode=0\nrec[0].erase_blk_size=0\nrec[0].logical_blk_size=0\n");
  EXPECT_EQ(device.log(), kNoDt);

  // An empty property leaves the choice to the command line.
  device.set_property("ro.boot.hardware", "");
  device.write_file("/odm/etc/fstab.rbtest", "/a /b e ro wait\n");
  EXPECT_EQ(dump_default(device), "1 \"/odm/etc/fstab.rbtest\"");
  device.set_property("ro.boot.hardware", "prop");
  device.write_file("/fstab.prop", "/a /b e ro wait\n/c /d e ro wait\n");
  EXPECT_EQ(dump_default(device), "2 \"/fstab.prop\"");
  device.write_file("/vendor/etc/fstab.prop", "/a /b e ro wait\n");
  EXPECT_EQ(dump_default(device), "1 \"/vendor/etc/fstab.prop\"");
  device.remove("/vendor/etc/fstab.prop");
  device.remove("/fstab.prop");
  EXPECT_EQ(dump_default(device), "NULL TABLE");
  EXPECT_EQ(device.log(), kNoDt +
                              "E fstab_dump: [libfs_mgr]fs_mgr_read_fstab(): cannot open file: "
                              "'/fstab.prop': No such file or directory\n");

  // Recovery wins over every hardware-named table.
  device.write_file("/sbin/recovery", "");
  device.write_file("/etc/recovery.fstab", "/dev/block/by-name/system /system e ro slotselect\n");
  EXPECT_EQ(dump_default(device), "NULL TABLE");
  EXPECT_TRUE(log_has(device,
                      "E fstab_dump: [libfs_mgr]Error updating for slotselect\n"
                      "E fstab_dump: [libfs_mgr]fs_mgr_read_fstab(): failed to load fstab from : "
                      "'/etc/recovery.fstab'\n"));
  device.set_property("ro.boot.slot_suffix", "_b");
  EXPECT_EQ(dump_default(device, &r), "1 \"/etc/recovery.fstab\"");
  EXPECT_EQ(field(r.out, "rec[0].mount_source"), "\"/dev/block/by-name/system_b\"");

  for (const auto& args : std::vector<std::vector<std::string>>{{}, {"-x"}, {"a", "b"}}) {
    r = device.run(args, "fstab_dump");
    EXPECT_EQ(r.status, 2);
    EXPECT_EQ(r.err, "usage: fstab_dump FILE | fstab_dump --default\n");
  }
}

void write_dt_entry(FakeDevice& d, const std::string& name, const std::string& status,
                    const std::string& flags) {
  const std::string dir = "/dt/fstab/" + name + "/";
  if (!status.empty()) d.write_file(dir + "status", dt(status));
  d.write_file(dir + "dev", dt("/dev/block/by-name/" + name));
  d.write_file(dir + "type", dt("ext4"));
  d.write_file(dir + "mnt_flags", dt("ro"));
  d.write_file(dir + "fsmgr_flags", dt(flags));
}

TEST(DefaultFstab, DeviceTreeTableMergedFirst) {
  FakeDeviceConfig config;
  config.cmdline = "androidboot.android_dt_dir=/dt androidboot.slot=a\n";
  FakeDevice device(config);
  REQUIRE_DEVICE(device);
  device.set_property("ro.boot.hardware", "rbtest");
  device.write_file("/dt/compatible", dt("android,firmware"));
  device.write_file("/dt/fstab/compatible", dt("android,fstab"));
  write_dt_entry(device, "system", "okay", "wait,slotselect");
  write_dt_entry(device, "vendor", "ok", "wait");
  write_dt_entry(device, "odm", "disabled", "wait");
  write_dt_entry(device, "upper", "OK", "wait");
  write_dt_entry(device, ".hidden", "", "wait");
  device.write_file("/dt/fstab/plain", "x");

  RunResult r;
  EXPECT_EQ(dump_default(device, &r), "3 NULL");
  // Entries come in directory order, which the file system decides.
  std::string recs, log;
  DIR* dir = opendir(device.host_path("/dt/fstab").c_str());
  ASSERT_NE(dir, nullptr);
  while (dirent* e = readdir(dir)) {
    const std::string name = e->d_name;
    if (name == "system" || name == "vendor") {
      recs += "\"/dev/block/by-name/" + name + (name == "system" ? "_a" : "") + "\" \"/" + name +
              "\"\n";
    } else if (name == "odm" || name == "upper") {
      log += "I fstab_dump: [libfs_mgr]dt_fstab: Skip disabled entry for partition " + name + "\n";
    }
  }
  closedir(dir);
  EXPECT_EQ(field(r.out, "rec[0].mount_source") + " " + field(r.out, "rec[0].mount_point") + "\n" +
                field(r.out, "rec[1].mount_source") + " " + field(r.out, "rec[1].mount_point") +
                "\n",
            recs);
  EXPECT_EQ(field(r.out, "rec[2].mount_point"), "\"/data\"");
  EXPECT_EQ(device.log(), log);

  // An empty value leaves four columns, which the parser rejects; the text is logged line by
  // line.
  device.write_file("/dt/fstab/vendor/fsmgr_flags", dt(""));
  EXPECT_EQ(dump_default(device), "1 \"/vendor/etc/fstab.rbtest\"");
  EXPECT_TRUE(log_has(device,
                      "E fstab_dump: [libfs_mgr]Error parsing fs_mgr_options\n"
                      "E fstab_dump: [libfs_mgr]fs_mgr_read_fstab_dt(): failed to load fstab "
                      "from kernel:\n"));
  EXPECT_TRUE(log_has(device, "\nE fstab_dump: /dev/block/by-name/vendor /vendor ext4 ro \n"));

  device.remove("/dt/fstab/vendor/fsmgr_flags");
  EXPECT_EQ(dump_default(device), "1 \"/vendor/etc/fstab.rbtest\"");
  EXPECT_TRUE(log_has(
      device, "E fstab_dump: [libfs_mgr]dt_fstab: Failed to find type for partition vendor\n"));
  EXPECT_TRUE(log_has(device, kNoDt));

  write_dt_entry(device, "vendor", "ok", "wait");
  device.write_file("/dt/fstab/compatible", dt("android,fstab,extra"));
  EXPECT_EQ(dump_default(device), "1 \"/vendor/etc/fstab.rbtest\"");
  EXPECT_TRUE(log_has(device, kNoDt));

  // The hardware name from the device tree, then from nowhere.
  device.write_file("/dt/fstab/compatible", dt("android,fstab"));
  device.set_property("ro.boot.hardware", "");
  device.write_file("/dt/hardware", dt("dthw"));
  device.write_file("/vendor/etc/fstab.dthw", "/a /b e ro wait\n/c /d e ro wait\n");
  EXPECT_EQ(dump_default(device), "4 NULL");
  device.remove("/dt/hardware");
  EXPECT_EQ(dump_default(device), "2 NULL");
  EXPECT_TRUE(log_has(device,
                      "W fstab_dump: [libfs_mgr]fs_mgr_read_fstab_default(): failed to find "
                      "device hardware name\n"));
  EXPECT_TRUE(log_has(device,
                      "E fstab_dump: [libfs_mgr]fs_mgr_read_fstab(): cannot open file: '': No "
                      "such file or directory\n"));

  device.write_file("/dt/compatible", dt("android,firmware,x"));
  EXPECT_EQ(dump_default(device), "NULL TABLE");
  EXPECT_TRUE(log_has(device, kNoDt));
}

TEST(BootConfig, CommandLineDeviceTreeAndSlot) {
  FakeDeviceConfig config;
  config.cmdline =
      "console=ttyS0 androidboot.hardware=abc androidboot.hardware=def androidboot.mode=a=b "
      "androidboot.empty= androidboot.bare  androidboot.android_dt_dir=/dt "
      "androidboot.serial=\"x y\" androidboot.last=z\n";
  FakeDevice device(config);
  REQUIRE_DEVICE(device);
  device.set_property("ro.boot.hardware", "");
  device.set_property("ro.boot.prop", "pv");
  device.write_file("/dt/compatible", dt("android,firmware"));
  device.write_file("/dt/dtkey", dt("v"));
  device.write_file("/dt/one", dt(""));
  RunResult r = device.run_in_root([] {
    for (const char* key : {"hardware", "mode", "empty", "bare", "prop", "dtkey", "one", "serial",
                            "last", "missing"}) {
      std::string value = "unchanged";
      bool found = fs_mgr_get_boot_config(key, &value);
      printf("%s=%d:%s\n", key, found, found ? value.c_str() : "");
    }
    std::string value = "unchanged";
    printf("cmdline prop=%d:%s\n", fs_mgr_get_boot_config_from_kernel_cmdline("prop", &value),
           value.c_str());
    auto write = [](const char* path, const std::string& content) {
      FILE* f = fopen(path, "w");
      fwrite(content.data(), 1, content.size(), f);
      fclose(f);
    };
    printf("dir=%s suffix=%s\n", get_android_dt_dir().c_str(), fs_mgr_get_slot_suffix().c_str());
    write("/dt/slot_suffix", "-c?");
    printf("suffix=%s\n", fs_mgr_get_slot_suffix().c_str());
    write("/dt/slot", dt("b"));
    printf("suffix=%s\n", fs_mgr_get_slot_suffix().c_str());
    for (const std::string& compatible :
         {dt("android,firmware,x"), std::string("android,firmware")}) {
      write("/dt/compatible", compatible);
      printf("compatible=%d\n", is_dt_compatible());
    }
    return 0;
  });
  EXPECT_EQ(r.status, 0) << r.err;
  EXPECT_EQ(r.out,
            "hardware=1:abc\nmode=0:\nempty=1:\nbare=0:\nprop=1:pv\ndtkey=1:v\none=1:\n"
            "serial=1:\"x\nlast=1:z\nmissing=0:\ncmdline prop=0:unchanged\ndir=/dt suffix=\n"
            "suffix=-c\nsuffix=_b\ncompatible=0\ncompatible=0\n");
}

TEST(BlockDevice, EncryptionState) {
  FakeDeviceConfig config;
  config.data_fstab_line =
      "/dev/block/userdata /data ext4 rw wait,forcefdeorfbe=footer\n"
      "/dev/block/cache /cache ext4 rw wait\n";
  FakeDevice device(config);
  REQUIRE_DEVICE(device);
  const std::pair<const char*, const char*> states[] = {
      {nullptr, "/dev/block/userdata 1 0\n/dev/block/cache 0 0\n"},
      {"encrypted", "/dev/block/userdata 1 1\n/dev/block/cache 0 0\n"},
      {"unencrypted", "/dev/block/userdata 1 0\n/dev/block/cache 0 0\n"},
      {"encrypted ", "/dev/block/userdata 1 0\n/dev/block/cache 0 0\n"},
  };
  for (const auto& state : states) {
    if (state.first != nullptr) device.set_property("ro.crypto.state", state.first);
    RunResult r = device.run_in_root([] {
      platform_init_logging();
      fstab* table = fs_mgr_read_fstab_default();
      for (const char* path : {"/data/vendor/ramdump/RAMDUMP_RESERVED", "/cache/x"}) {
        int encryptable = -1, encrypted = -1;
        const char* dev = find_block_device(path, table, &encryptable, &encrypted);
        printf("%s %d %d\n", dev != nullptr ? dev : "null", encryptable, encrypted);
      }
      fs_mgr_free_fstab(table);
      return 0;
    });
    EXPECT_EQ(r.out, state.second) << (state.first ? state.first : "(unset)");
  }
}

}  // namespace
