// Runs the tool's main paths under valgrind's memcheck inside the fake device root (run by
// scripts/valgrind.sh, as root): the switch modes, conversion (create and arm, read-out,
// integrity test) and the boot entry collecting a stored dump and deleting a disabled one.
// Fails on an unexpected exit status, any invalid access, and any leak but the memory the tool
// keeps on purpose (valgrind.supp).
#include <stdio.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "tests/harness/chain_checks.h"
#include "tests/harness/fake_device.h"

namespace {

const char kReserved[] = "/data/vendor/ramdump/RAMDUMP_RESERVED";
const char kConverted[] = "/data/vendor/ramdump/converted";

// Runs a program of the root ("memcheck": the tool under memcheck, see main); true when it
// exits with status 0, which memcheck turns into 99 when it found anything.
bool run(FakeDevice& device, const std::vector<std::string>& args,
         const std::string& program = "memcheck") {
  RunResult r = device.run(args, program);
  std::string shown = program;
  for (const std::string& arg : args) shown += " " + arg;
  printf("%s: exit %d\n", shown.c_str(), r.status);
  if (r.status != 0) printf("%s%s\n", r.err.c_str(), device.log().c_str());
  return r.status == 0;
}

}  // namespace

int main() {
  std::string why;
  if (!fake_device_supported(&why)) {
    fprintf(stderr, "valgrind_paths: %s\n", why.c_str());
    return 1;
  }
  if (!enter_private_mount_namespace("valgrind_paths: private mount namespace")) return 1;
  FakeDeviceConfig config;
  config.data_bytes = 16ull << 30;  // the boot entry wants 6 GiB free beside the reserved file
  config.cmdline = "console=ttyS0 androidboot.hardware=rbtest androidboot.android_dt_dir=/dt\n";
  FakeDevice device(config);
  if (!device.setup_error().empty()) {
    fprintf(stderr, "fake device: %s\n", device.setup_error().c_str());
    return 1;
  }
  // A device-tree table as well as the file's, so that the tables are merged, and a "verify="
  // value in the file, which a released table keeps.
  const std::string nul(1, '\0');
  const std::pair<const char*, std::string> files[] = {
      {"/dt/compatible", "android,firmware" + nul},
      {"/dt/fstab/compatible", "android,fstab" + nul},
      {"/dt/fstab/vendor/dev", "/dev/block/bootdevice/by-name/vendor" + nul},
      {"/dt/fstab/vendor/type", "ext4" + nul},
      {"/dt/fstab/vendor/mnt_flags", "ro,barrier=1" + nul},
      {"/dt/fstab/vendor/fsmgr_flags", "wait" + nul},
      {"/vendor/etc/fstab.rbtest",
       "/dev/block/bootdevice/by-name/system /system ext4 ro wait,verify=/dev/x\n"
       "/dev/block/bootdevice/by-name/userdata /data ext4 noatime,nosuid,nodev "
       "wait,check,encryptable=footer\n"},
      {"/tmp/valgrind.supp", read_host_file(RB_VALGRIND_SUPPRESSIONS)},
      {"/system/bin/memcheck",
       "#!/bin/sh\nexec valgrind --error-exitcode=99 --leak-check=full "
       "--show-leak-kinds=definite,indirect,possible "
       "--errors-for-leak-kinds=definite,indirect,possible --suppressions=/tmp/valgrind.supp "
       "/system/bin/reserveblocks \"$@\"\n"},
      {"/tmp/RAMDUMP_MSG.txt", "watchdog timeout\n"},
      {"/tmp/memory0.bin", std::string(20000, '\x22')},
      {kReserved, std::string(64 * 4096, '\xFF')},
  };
  for (const auto& [path, content] : files) device.write_file(path, content, 0755);

  bool ok = true;
  for (const std::vector<std::string>& args :
       std::vector<std::vector<std::string>>{{"-d"},
                                             {"-s"},
                                             {"-e"},
                                             {"-p", "-i", "1234", "-c", "262144", kConverted},
                                             {"-r", std::string(kConverted) + ".out", kConverted},
                                             {"-t", "-i", "1234", kConverted}}) {
    ok = run(device, args) && ok;
  }
  // A small reserved file holding a dump: the boot entry reads it out, extracts the message and
  // re-arms. Then disabled: the boot entry deletes the reserved file and the outputs.
  ok = run(device, {"-i", "feed", kReserved}, "reserveblocks") && ok;
  write_host_file(device.misc_host_path(),
                  device.misc_bytes().replace(
                      3184, 24, make_ibh(map_file(device, kReserved, 1)[0], 4096, 64, 0xfeed, 1)));
  ok = run(device, {MISC_DEVICE, USERDATA_DEVICE, "/tmp/memory0.bin", "/tmp/RAMDUMP_MSG.txt"},
           "firmware_sim") &&
       ok;
  ok = run(device, {"-a", "-p"}) && ok;
  if (device.read_file("/data/vendor/ramdump/apq/00/RAMDUMP_MSG.txt") != "watchdog timeout\n") {
    printf("the boot entry under memcheck did not extract the message\n");
    ok = false;
  }
  ok = run(device, {"-d"}, "reserveblocks") && ok;
  ok = run(device, {"-a"}) && ok;
  printf("memcheck: %s\n", ok ? "no errors" : "FAILED");
  return ok ? 0 : 1;
}
