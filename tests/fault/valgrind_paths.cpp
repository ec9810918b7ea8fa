// Runs the tool's main paths under valgrind's memcheck inside the fake device root: the switch
// modes, conversion (create and arm, read-out, integrity test) and the boot entry collecting a
// stored dump and deleting a disabled one. Fails on any invalid access or unsuppressed leak
// (valgrind.supp lists the memory the tool keeps on purpose) and on an unexpected exit status.
// Run by scripts/valgrind.sh, as root.
#include <sched.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/mount.h>
#include <unistd.h>

#include <map>
#include <regex>
#include <sstream>
#include <string>
#include <vector>

#include "tests/harness/chain_checks.h"
#include "tests/harness/fake_device.h"

namespace {

const char kValgrind[] = "/usr/bin/valgrind";
const char kSuppressions[] = "/tmp/valgrind.supp";
const char kReserved[] = "/data/vendor/ramdump/RAMDUMP_RESERVED";
const char kConverted[] = "/data/vendor/ramdump/converted";
const int kValgrindError = 99;

struct Path {
  std::vector<std::string> args;
  int status;
};

std::map<std::string, int> used_suppressions;

// Runs the tool under memcheck; true when it exits as expected without memcheck errors.
bool run_checked(FakeDevice& device, const Path& path) {
  const std::string log_path = "/tmp/memcheck.log";
  device.remove(log_path);
  std::vector<std::string> args = {kValgrind,
                                   "-v",
                                   "--tool=memcheck",
                                   "--error-exitcode=99",
                                   "--leak-check=full",
                                   "--show-leak-kinds=definite,indirect,possible",
                                   "--errors-for-leak-kinds=definite,indirect,possible",
                                   "--track-origins=yes",
                                   "--vgdb=no",
                                   std::string("--suppressions=") + kSuppressions,
                                   "--log-file=" + log_path,
                                   "/system/bin/reserveblocks"};
  args.insert(args.end(), path.args.begin(), path.args.end());
  RunResult r = device.run_in_root(
      [&]() {
        std::vector<char*> argv;
        for (std::string& arg : args) argv.push_back(&arg[0]);
        argv.push_back(nullptr);
        execv(kValgrind, argv.data());
        perror("execv valgrind");
        return 127;
      },
      600);
  const std::string log = device.read_file(log_path);
  std::smatch m;
  std::string summary = std::regex_search(log, m, std::regex("ERROR SUMMARY: [0-9]+ errors"))
                            ? m.str()
                            : "no error summary";
  std::string shown;
  for (const std::string& arg : path.args) shown += " " + arg;
  const bool ok = !r.timed_out && r.status == path.status && summary == "ERROR SUMMARY: 0 errors";
  printf("memcheck reserveblocks%s: exit %d (expected %d), %s\n", shown.c_str(), r.status,
         path.status, summary.c_str());
  const std::regex used("used_suppression: +([0-9]+) ([^ ]+)");
  for (std::sregex_iterator it(log.begin(), log.end(), used); it != std::sregex_iterator(); ++it) {
    used_suppressions[(*it)[2]] += std::stoi((*it)[1]);
  }
  if (!ok) {
    // memcheck's own report; the "--" lines are the -v chatter.
    std::istringstream lines(log);
    for (std::string line; std::getline(lines, line);) {
      if (line.rfind("==", 0) == 0) printf("%s\n", line.c_str());
    }
    printf("--- standard error ---\n%s\n", r.err.c_str());
  }
  return ok;
}

bool run_plain(FakeDevice& device, const std::vector<std::string>& args,
               const std::string& program = "reserveblocks") {
  RunResult r = device.run(args, program);
  if (r.status != 0)
    fprintf(stderr, "%s failed: %s%s\n", program.c_str(), r.err.c_str(), device.log().c_str());
  return r.status == 0;
}

}  // namespace

int main() {
  if (geteuid() != 0) {
    fprintf(stderr, "valgrind_paths: needs root (fake device root)\n");
    return 1;
  }
  if (unshare(CLONE_NEWNS) != 0 || mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr)) {
    perror("private mount namespace");
    return 1;
  }
  FakeDeviceConfig config;
  config.data_bytes = 16ull << 30;  // the boot entry wants 6 GiB free beside the reserved file
  // A device-tree table as well as the file's, so that the tables are merged; a "verify="
  // value in the file, which a released table keeps.
  config.cmdline = "console=ttyMSM0 androidboot.hardware=rbtest androidboot.android_dt_dir=/dt\n";
  FakeDevice device(config);
  if (!device.setup_error().empty()) {
    fprintf(stderr, "fake device: %s\n", device.setup_error().c_str());
    return 1;
  }
  device.write_file("/dt/compatible", std::string("android,firmware", 17));
  device.write_file("/dt/fstab/compatible", std::string("android,fstab", 14));
  device.write_file("/dt/fstab/vendor/dev",
                    std::string("/dev/block/bootdevice/by-name/vendor", 37));
  device.write_file("/dt/fstab/vendor/type", std::string("ext4", 5));
  device.write_file("/dt/fstab/vendor/mnt_flags", std::string("ro,barrier=1", 13));
  device.write_file("/dt/fstab/vendor/fsmgr_flags", std::string("wait", 5));
  device.write_file("/vendor/etc/fstab.rbtest",
                    "/dev/block/bootdevice/by-name/system /system ext4 ro wait,verify=/dev/x\n"
                    "/dev/block/bootdevice/by-name/userdata /data ext4 noatime,nosuid,nodev "
                    "wait,check,encryptable=footer\n");
  device.write_file(kSuppressions, read_host_file(RB_VALGRIND_SUPPRESSIONS));

  bool ok = true;
  const std::vector<Path> switch_and_conversion = {
      {{"-e"}, 0},
      {{"-s"}, 0},
      {{"-d"}, 0},
      {{"-e"}, 0},
      {{"-p", "-i", "1234", "-c", "262144", kConverted}, 0},
      {{"-r", std::string(kConverted) + ".out", kConverted}, 0},
      {{"-t", "-i", "1234", kConverted}, 0},
  };
  for (const Path& path : switch_and_conversion) ok = run_checked(device, path) && ok;

  // A small reserved file holding a dump: the boot entry reads it out, extracts the message
  // and re-arms.
  device.write_file(kReserved, std::string(64 * 4096, '\xFF'), 0744);
  device.write_file("/tmp/RAMDUMP_MSG.txt", "watchdog bite\n");
  device.write_file("/tmp/ddr.bin", std::string(20000, '\x22'));
  ok = run_plain(device, {"-i", "feed", kReserved}) && ok;
  std::string misc = device.misc_bytes();
  misc.replace(3184, 24, make_ibh(map_file(device, kReserved, 1)[0], 4096, 64, 0xfeed, 1));
  write_host_file(device.misc_host_path(), misc);
  ok = run_plain(device, {MISC_DEVICE, USERDATA_DEVICE, "/tmp/ddr.bin", "/tmp/RAMDUMP_MSG.txt"},
                 "firmware_sim") &&
       ok;
  ok = run_checked(device, {{"-a", "-p"}, 0}) && ok;
  if (device.read_file("/data/vendor/ramdump/apq/00/RAMDUMP_MSG.txt") != "watchdog bite\n") {
    printf("the boot entry under memcheck did not extract the message\n");
    ok = false;
  }
  // Disabled: the boot entry deletes the reserved file and the outputs.
  ok = run_plain(device, {"-d"}) && ok;
  ok = run_checked(device, {{"-a"}, 0}) && ok;

  for (const auto& [name, count] : used_suppressions) {
    printf("suppression used: %s (%d)\n", name.c_str(), count);
  }
  printf("memcheck: %s\n", ok ? "no errors" : "FAILED");
  return ok ? 0 : 1;
}
