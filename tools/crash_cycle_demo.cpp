// crash_cycle_demo: takes a simulated phone through a whole crash cycle with the real
// reserveblocks binary, in a throw-away device root with a 16 GiB ext4 /data on a loop device:
// enable, first boot (create and arm the reserved area), a crash stored by the simulated
// firmware, second boot (read-out, message extraction, re-arming) and a third boot. Shows the
// properties, the stored initial block header, the files and the log after every step.
#include <stdio.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <sstream>
#include <string>
#include <vector>

#include "tests/harness/chain_checks.h"
#include "tests/harness/fake_device.h"

namespace {

const char kReserved[] = "/data/vendor/ramdump/RAMDUMP_RESERVED";
const char kOutput[] = "/data/vendor/ramdump/apq/00/RAMDUMP_OUTPUT";
const char kMessage[] = "/data/vendor/ramdump/apq/00/RAMDUMP_MSG.txt";

double now_seconds() {
  struct timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return ts.tv_sec + ts.tv_nsec / 1e9;
}

void heading(const std::string& text) { printf("\n=== %s ===\n", text.c_str()); }

std::string state_words(uint32_t state) {
  std::string words;
  if (state & 1) words += " armed";
  if (state & 2) words += " dump-present";
  return words.empty() ? " (none)" : words;
}

void show_header(const FakeDevice& device) {
  std::string ibh = stored_ibh(device);
  if (ibh == std::string(24, '\0')) {
    printf("  stored initial block header: 24 zero bytes (no chain)\n");
    return;
  }
  printf(
      "  stored initial block header: magic \"%s\" first_block %u block_size %u "
      "block_count %u initial_crc %08x state %u%s\n",
      ibh.substr(0, 4).c_str(), le32_at(ibh, 4), le32_at(ibh, 8), le32_at(ibh, 12),
      le32_at(ibh, 16), le32_at(ibh, 20), state_words(le32_at(ibh, 20)).c_str());
}

void show_file(const FakeDevice& device, const char* path) {
  struct stat st;
  if (stat(device.host_path(path).c_str(), &st) != 0) {
    printf("  %s: absent\n", path);
  } else {
    printf("  %s: %lld bytes, mode %04o\n", path, static_cast<long long>(st.st_size),
           st.st_mode & 07777);
  }
}

void show_state(FakeDevice& device) {
  std::string flag = device.misc_bytes().substr(3216, 4);
  printf("  misc enable flag: \"%s\"\n", flag.c_str());
  show_header(device);
  printf("  debug.kvo.kvdump = \"%s\"\n", device.property("debug.kvo.kvdump").c_str());
  printf("  debug.kvo.ramdump_new_directory = \"%s\"\n",
         device.property("debug.kvo.ramdump_new_directory").c_str());
  for (const char* path : {kReserved, kOutput, kMessage}) show_file(device, path);
  printf("  log:\n");
  std::istringstream log(tool_log(device));
  std::string line;
  while (std::getline(log, line)) printf("    %s\n", line.c_str());
  device.clear_log();
}

bool run_step(FakeDevice& device, const std::string& title, const std::vector<std::string>& args,
              const std::string& program = "reserveblocks") {
  heading(title);
  std::string shown = program;
  for (const std::string& arg : args) shown += " " + arg;
  printf("$ %s\n", shown.c_str());
  fflush(stdout);
  double start = now_seconds();
  RunResult r = device.run(args, program, 1800);
  printf("%s", r.out.c_str());
  // The tool's standard error holds its progress lines, already shown as they came.
  if (program != "reserveblocks") printf("%s", r.err.c_str());
  printf("  exit status %d after %.1f s\n", r.status, now_seconds() - start);
  if (r.timed_out) return false;
  if (program == "reserveblocks") show_state(device);
  return true;
}

}  // namespace

int main() {
  std::string why;
  if (!fake_device_supported(&why)) {
    fprintf(stderr, "crash_cycle_demo: %s\n", why.c_str());
    return 1;
  }
  if (!enter_private_mount_namespace("crash_cycle_demo: private mount namespace")) return 1;
  setvbuf(stdout, nullptr, _IOLBF, 0);
  double start = now_seconds();

  FakeDeviceConfig config;
  config.data_bytes = 16ull << 30;
  FakeDevice device(config);
  if (!device.setup_error().empty()) {
    fprintf(stderr, "crash_cycle_demo: cannot set up the device root: %s\n",
            device.setup_error().c_str());
    return 1;
  }
  heading("A fake phone");
  printf("  /data: 16 GiB ext4 on %s, known to the device as %s\n", device.data_device().c_str(),
         USERDATA_DEVICE);
  printf("  misc partition: a 1 MiB image at %s\n", MISC_DEVICE);
  printf("  mount table: /vendor/etc/fstab.rbtest, hardware name from /proc/cmdline\n");
  printf("  free space on /data: %.2f GiB\n", device.free_space() / 1073741824.0);

  // Progress lines arrive as "done/total": on a terminal they update one line in place,
  // otherwise every quarter of the way gets a line of its own.
  const bool terminal = isatty(STDOUT_FILENO);
  int last_quarter = -1;
  device.set_stderr_listener([terminal, &last_quarter](const std::string& line) {
    unsigned long done = 0, total = 0;
    if (sscanf(line.c_str(), "%lu/%lu", &done, &total) != 2 || total == 0) return;
    if (terminal) {
      printf("\r  progress %-20s", line.c_str());
      fflush(stdout);
      return;
    }
    int quarter = static_cast<int>(done * 4 / total);
    if (done == 0 || quarter != last_quarter) printf("  progress %s\n", line.c_str());
    last_quarter = quarter;
  });

  bool ok = run_step(device, "Switch the feature on", {"-e"}) &&
            run_step(device,
                     "First boot: create and arm the reserved area ('fail' is expected: "
                     "there was no dump to collect)",
                     {"-a", "-p"});
  printf("\n");
  if (!ok) return 1;

  heading("The phone crashes: the firmware follows the chain and stores a dump");
  std::string message =
      "Kernel panic - not syncing: Fatal exception in interrupt\n"
      "CPU: 3 PID: 0 Comm: swapper/3 Tainted: G W\n"
      "Call trace:\n  watchdog_timer_fn+0x28/0x40\n  handle_irq+0x48/0x80\n";
  device.write_file("/tmp/kernel_log.bin", std::string(200000, 't'));
  device.write_file("/tmp/RAMDUMP_MSG.txt", message);
  std::string memory(8 << 20, '\0');
  for (size_t i = 0; i < memory.size(); ++i) memory[i] = static_cast<char>(i * 31 + (i >> 10));
  device.write_file("/tmp/memory0.bin", memory);
  if (!run_step(device, "Firmware stores three files",
                {MISC_DEVICE, USERDATA_DEVICE, "/tmp/kernel_log.bin", "/tmp/RAMDUMP_MSG.txt",
                 "/tmp/memory0.bin"},
                "firmware_sim")) {
    return 1;
  }
  show_header(device);

  ok = run_step(device, "Second boot: read out, extract the message, re-arm", {"-a", "-p"});
  printf("\n");
  if (!ok) return 1;
  printf("  extracted %s:\n", kMessage);
  std::istringstream extracted(device.read_file(kMessage));
  std::string line;
  while (std::getline(extracted, line)) printf("    | %s\n", line.c_str());

  if (!run_step(device, "Third boot: nothing new to collect", {"-a"})) return 1;
  char crc[16];
  snprintf(crc, sizeof(crc), "%x", le32_at(stored_ibh(device), 16));
  if (!run_step(device, "Integrity test of the re-armed chain", {"-t", "-i", crc, kReserved})) {
    return 1;
  }
  heading("Done");
  printf("  the whole cycle took %.0f s; the device root is now torn down\n",
         now_seconds() - start);
  return 0;
}
