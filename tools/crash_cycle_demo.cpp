// crash_cycle_demo: takes a simulated phone through a whole crash cycle with the real
// reserveblocks binary, in a throw-away device root with a 16 GiB ext4 /data on a loop device:
// enable, first boot (create and arm the reserved area), a crash stored by the simulated
// firmware, second boot (read-out, message extraction, re-arming) and a third boot. Shows the
// properties, the stored initial block header, the files and the log after every step. Then
// ramdump_inspect opens the collected dump as on an engineer's workstation, and a second crash
// places the message record's header where the extraction at boot misses it and the inspector
// does not. Exits 0 only when every step ends as it should and every extracted file equals what
// the firmware stored; 77 when it cannot run here (not root).
#include <errno.h>
#include <stdio.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <filesystem>
#include <sstream>
#include <string>
#include <vector>

#include "ramdump/chain_format.h"
#include "tests/harness/chain_checks.h"
#include "tests/harness/fake_device.h"

namespace {

const char kReserved[] = "/data/vendor/ramdump/RAMDUMP_RESERVED";
const char kOutput[] = "/data/vendor/ramdump/apq/00/RAMDUMP_OUTPUT";
const char kMessage[] = "/data/vendor/ramdump/apq/00/RAMDUMP_MSG.txt";
const char kMessageName[] = "RAMDUMP_MSG.txt";

// The extraction at boot takes the read-out apart in 4096-byte units, whatever the block size.
const size_t kUnitPayload = 4096 - CHAIN_BLOCK_HEADER_SIZE;

double now_seconds() {
  struct timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return ts.tv_sec + ts.tv_nsec / 1e9;
}

void heading(const std::string& text) { printf("\n=== %s ===\n", text.c_str()); }

void print_indented(const std::string& text, const char* indent = "  ") {
  std::istringstream in(text);
  for (std::string line; std::getline(in, line);) printf("%s%s\n", indent, line.c_str());
}

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

// Shows the state after a run of the tool and hands back the run's log, which it clears.
std::string show_state(FakeDevice& device) {
  std::string flag = device.misc_bytes().substr(3216, 4);
  printf("  misc enable flag: \"%s\"\n", flag.c_str());
  show_header(device);
  printf("  debug.kvo.kvdump = \"%s\"\n", device.property("debug.kvo.kvdump").c_str());
  printf("  debug.kvo.ramdump_new_directory = \"%s\"\n",
         device.property("debug.kvo.ramdump_new_directory").c_str());
  for (const char* path : {kReserved, kOutput, kMessage}) show_file(device, path);
  printf("  log:\n");
  std::string log = tool_log(device);
  print_indented(log, "    ");
  device.clear_log();
  return log;
}

// False when the run does not end with the expected status (or, for a boot, outcome).
bool run_step(FakeDevice& device, const std::string& title, const std::vector<std::string>& args,
              int expected, const std::string& program = "reserveblocks",
              std::string* log = nullptr) {
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
  const std::string outcome = expected == 0 ? "done" : "fail";
  if (program == "reserveblocks") {
    std::string shown_log = show_state(device);
    if (log != nullptr) *log = shown_log;
  }
  if (r.status == expected && (args[0] != "-a" || device.property("debug.kvo.kvdump") == outcome)) {
    return true;
  }
  printf("  FAILED: expected exit status %d%s\n", expected,
         args[0] == "-a" ? (" and debug.kvo.kvdump = \"" + outcome + "\"").c_str() : "");
  return false;
}

struct DumpFile {
  std::string name;
  std::string content;
};

// The firmware stores the files, given to it from the root's /tmp, after a filler record when
// first_record_at is nonzero.
bool store_dump(FakeDevice& device, const std::string& title, const std::vector<DumpFile>& files,
                size_t first_record_at = 0) {
  std::vector<std::string> args;
  if (first_record_at != 0) args = {"--first-record-at", std::to_string(first_record_at)};
  args.insert(args.end(), {MISC_DEVICE, USERDATA_DEVICE});
  for (const DumpFile& file : files) {
    device.write_file("/tmp/" + file.name, file.content);
    args.push_back("/tmp/" + file.name);
  }
  if (!run_step(device, title, args, 0, "firmware_sim")) return false;
  show_header(device);
  return true;
}

// Where the inspector runs: a directory on the host that stands for the engineer's workstation.
// It sees the phone's files at their host paths, shown as $PHONE/..., as if pulled with adb.
struct Workstation {
  std::string dir;
  std::string phone;  // the host path of the device root
};

std::string with_phone_shown(const Workstation& ws, std::string text) {
  for (size_t at = 0; (at = text.find(ws.phone, at)) != std::string::npos;) {
    text.replace(at, ws.phone.size(), "$PHONE");
  }
  return text;
}

// Runs the built ramdump_inspect in the workstation directory and shows its output, standard
// output and error as they interleave; false when its exit status is not the expected one.
bool inspect(const Workstation& ws, const std::vector<std::string>& args, int expected = 0,
             std::string* output = nullptr) {
  std::string shown = "ramdump_inspect";
  for (const std::string& arg : args) shown += " " + with_phone_shown(ws, arg);
  printf("\n$ %s\n", shown.c_str());
  fflush(stdout);
  int fds[2];
  if (pipe(fds) != 0) {
    perror("pipe");
    return false;
  }
  const std::string program = std::string(RB_BUILD_DIR) + "/ramdump_inspect";
  pid_t pid = fork();
  if (pid == 0) {
    dup2(fds[1], STDOUT_FILENO);
    dup2(fds[1], STDERR_FILENO);
    close(fds[0]);
    close(fds[1]);
    std::vector<char*> argv = {const_cast<char*>("ramdump_inspect")};
    for (const std::string& arg : args) argv.push_back(const_cast<char*>(arg.c_str()));
    argv.push_back(nullptr);
    if (chdir(ws.dir.c_str()) == 0) execv(program.c_str(), argv.data());
    perror(program.c_str());
    _exit(127);
  }
  close(fds[1]);
  std::string text;
  char buf[4096];
  for (ssize_t n; (n = read(fds[0], buf, sizeof(buf))) != 0;) {
    if (n > 0) text.append(buf, static_cast<size_t>(n));
    if (n < 0 && errno != EINTR) break;
  }
  close(fds[0]);
  int wstatus = 0;
  while (pid > 0 && waitpid(pid, &wstatus, 0) < 0 && errno == EINTR) {
  }
  const int status = pid > 0 && WIFEXITED(wstatus) ? WEXITSTATUS(wstatus) : -1;
  print_indented(with_phone_shown(ws, text));
  if (output != nullptr) *output = text;
  if (status == expected) {
    printf("  exit status %d\n", status);
    return true;
  }
  printf("  exit status %d, expected %d\n", status, expected);
  return false;
}

// One line per file: whether what the inspector extracted into dir equals what was stored.
bool compare_extracted(const Workstation& ws, const std::string& dir, const DumpFile& file) {
  const std::string path = dir + "/" + file.name;
  const std::string extracted = read_host_file(ws.dir + "/" + path);
  if (extracted == file.content) {
    printf("  %s: identical to what the firmware stored (%zu bytes)\n", path.c_str(),
           file.content.size());
    return true;
  }
  printf("  %s: DIFFERS from what the firmware stored (%zu bytes, expected %zu)\n", path.c_str(),
         extracted.size(), file.content.size());
  return false;
}

// A crash's files: its message, and stand-ins for a kernel log and memory of the given sizes.
std::vector<DumpFile> crash_files(const std::string& message, size_t log_bytes,
                                  size_t memory_bytes) {
  std::string memory(memory_bytes, '\0');
  for (size_t i = 0; i < memory.size(); ++i) memory[i] = static_cast<char>(i * 31 + (i >> 10));
  return {{"kernel_log.bin", std::string(log_bytes, 't')},
          {kMessageName, message},
          {"memory0.bin", memory}};
}

// The inspector on the first collection: the misc items, the read-out and the chain on the
// device checked, the records listed and extracted.
bool inspect_collection(const FakeDevice& device, const Workstation& ws,
                        const std::vector<DumpFile>& stored) {
  heading("On the workstation: ramdump_inspect opens the collected dump");
  printf("  The engineer pulls RAMDUMP_OUTPUT and the misc partition with adb; here the\n");
  printf("  inspector reads them where they lie, PHONE=%s\n", ws.phone.c_str());
  const std::string misc = device.misc_host_path(), output = device.host_path(kOutput);
  bool ok = inspect(ws, {"misc", misc});
  ok = inspect(ws, {"verify", "--misc", misc, output}) && ok;
  printf("  (the device's chain, read directly and read only: %s holds /data)\n",
         device.data_device().c_str());
  ok = inspect(ws, {"verify", "--device", device.data_device(), "--misc", misc}) && ok;
  std::string listed;
  ok = inspect(ws, {"list", output}, 0, &listed) && ok;
  if (!contains(listed, "writes RAMDUMP_MSG.txt completely")) {
    printf("  list does not say that the extraction at boot writes %s\n", kMessageName);
    ok = false;
  }
  ok = inspect(ws, {"extract", output, "crash1"}) && ok;
  for (const DumpFile& file : stored) ok = compare_extracted(ws, "crash1", file) && ok;
  return ok;
}

// The stream offset for the first file that puts the message record's header gap bytes before
// the end of a unit's payload, given the files stored ahead of the message.
size_t first_record_offset(const std::vector<DumpFile>& files, size_t gap) {
  size_t ahead = 0;
  for (const DumpFile& file : files) {
    if (file.name == kMessageName) break;
    ahead += DUMP_FILE_RECORD_SIZE + file.content.size();
  }
  size_t at = (kUnitPayload - gap + kUnitPayload - ahead % kUnitPayload) % kUnitPayload;
  return at < DUMP_FILE_RECORD_SIZE ? at + kUnitPayload : at;  // room for the filler record
}

// A second crash whose message record header straddles two units where the extraction at boot
// reassembles it wrongly: the phone misses the message, the inspector recovers it.
bool missed_message(FakeDevice& device, const Workstation& ws) {
  heading("A second crash: the message record's header across a unit boundary");
  const std::vector<DumpFile> files = crash_files(
      "Unable to handle kernel NULL pointer dereference at virtual address 0000000000000008\n"
      "Internal error: Oops: 96000005 [#1] PREEMPT SMP\n"
      "CPU: 1 PID: 412 Comm: kworker/1:2 Tainted: G W\n"
      "Call trace:\n  work_item_handler+0x3c/0x90\n  process_one_work+0x1d8/0x4a0\n"
      "  worker_thread+0x54/0x410\n",
      150000, 4 << 20);
  const size_t gap = 28;  // the extraction at boot misses a header 17 to 39 bytes before the end
  const size_t first = first_record_offset(files, gap);
  const size_t header_at = first + DUMP_FILE_RECORD_SIZE + files[0].content.size();
  printf("  Every 4096-byte unit of the read-out carries %zu bytes of the stream. With the\n",
         kUnitPayload);
  printf("  first file at stream offset %zu (after a filler record), %s's record\n", first,
         files[0].name.c_str());
  printf("  (%zu + %zu bytes) puts the message record's header at %zu = %zu x %zu + %zu:\n",
         DUMP_FILE_RECORD_SIZE, files[0].content.size(), header_at, header_at / kUnitPayload,
         kUnitPayload, header_at % kUnitPayload);
  printf("  it starts %zu bytes before the end of a unit's payload.\n",
         kUnitPayload - header_at % kUnitPayload);
  if (!store_dump(device, "Firmware stores the second dump", files, first)) return false;

  std::string log;
  if (!run_step(device, "Next boot: read out, extract the message, re-arm", {"-a", "-p"}, 0,
                "reserveblocks", &log)) {
    return false;
  }
  const std::string& message = files[1].content;
  bool ok = true;
  if (!device.exists(kMessage)) {
    printf("  %s: absent: the extraction at boot missed it\n", kMessageName);
  } else if (device.read_file(kMessage) != message) {
    printf("  %s: incomplete: the extraction at boot missed part of it\n", kMessageName);
  } else {
    printf("  %s: complete, which this placement was meant to prevent\n", kMessageName);
    ok = false;
  }
  // The stream's clean end logs a bad magic too: what tells is that the message was not found.
  const size_t bad = log.find("* bad magic");
  if (bad != std::string::npos && !contains(log, "Found file 'RAMDUMP_MSG.txt'")) {
    printf("  the log's \"%s\" is where it stopped\n",
           log.substr(bad, log.find('\\', bad) - bad).c_str());
  } else {
    printf("  the log does not show the extraction stopping at the message record\n");
    ok = false;
  }

  heading("On the workstation: the inspector recovers the message");
  const std::string output = device.host_path(kOutput);
  std::string listed;
  ok = inspect(ws, {"list", output}, 0, &listed) && ok;
  if (!contains(listed, "without RAMDUMP_MSG.txt")) {
    printf("  list does not say that the extraction at boot misses %s\n", kMessageName);
    ok = false;
  }
  ok = inspect(ws, {"extract", output, "crash2", kMessageName}) && ok;
  ok = compare_extracted(ws, "crash2", files[1]) && ok;
  print_indented(read_host_file(ws.dir + "/crash2/" + kMessageName), "    | ");
  return ok;
}

}  // namespace

int main() {
  std::string why;
  if (!fake_device_supported(&why)) {
    fprintf(stderr, "crash_cycle_demo: %s\n", why.c_str());
    return 77;  // skipped, for CTest
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
      printf("\r  progress %-20s%s", line.c_str(), done == total ? "\n" : "");
      fflush(stdout);
      return;
    }
    int quarter = static_cast<int>(done * 4 / total);
    if (done == 0 || quarter != last_quarter) printf("  progress %s\n", line.c_str());
    last_quarter = quarter;
  });

  bool ok = run_step(device, "Switch the feature on", {"-e"}, 0) &&
            run_step(device,
                     "First boot: create and arm the reserved area ('fail' is expected: "
                     "there was no dump to collect)",
                     {"-a", "-p"}, 255);
  if (!ok) return 1;
  struct stat st;
  if (stat(device.host_path(kReserved).c_str(), &st) != 0 || st.st_size != 4429185024 ||
      (st.st_mode & 07777) != 0744) {
    printf("  FAILED: %s is not 4429185024 bytes with mode 0744\n", kReserved);
    return 1;
  }

  heading("The phone crashes: the firmware follows the chain and stores a dump");
  const std::vector<DumpFile> stored = crash_files(
      "Kernel panic - not syncing: Fatal exception in interrupt\n"
      "CPU: 3 PID: 0 Comm: swapper/3 Tainted: G W\n"
      "Call trace:\n  watchdog_timer_fn+0x28/0x40\n  handle_irq+0x48/0x80\n",
      200000, 8 << 20);
  if (!store_dump(device, "Firmware stores three files", stored)) return 1;

  if (!run_step(device, "Second boot: read out, extract the message, re-arm", {"-a", "-p"}, 0)) {
    return 1;
  }
  printf("  extracted %s:\n", kMessage);
  print_indented(device.read_file(kMessage), "    | ");
  if (device.read_file(kMessage) != stored[1].content) {
    printf("  FAILED: the message differs from the one the firmware stored\n");
    return 1;
  }

  if (!run_step(device, "Third boot: nothing new to collect", {"-a"}, 255)) return 1;
  char crc[16];
  snprintf(crc, sizeof(crc), "%x", le32_at(stored_ibh(device), 16));
  if (!run_step(device, "Integrity test of the re-armed chain", {"-t", "-i", crc, kReserved}, 0)) {
    return 1;
  }

  // Beside the device root, in the device's work directory, which its teardown removes.
  Workstation ws{
      std::filesystem::path(device.host_path("")).parent_path().string() + "/workstation",
      device.host_path("")};
  std::filesystem::create_directory(ws.dir);
  const bool first_ok = inspect_collection(device, ws, stored);
  const bool second_ok = missed_message(device, ws);

  heading("Done");
  printf("  the whole cycle took %.0f s; the device root is now torn down\n",
         now_seconds() - start);
  if (first_ok && second_ok) {
    printf("  every file the inspector extracted is identical to what the firmware stored\n");
    return 0;
  }
  printf("  FAILED: see the lines above\n");
  return 1;
}
