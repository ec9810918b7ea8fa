// Failing system calls (fault_inject.c, preloaded) and hostile on-disk data, for the real
// binaries in the fake device root: exit status, output, log, changed files and raw writes.
#include <gtest/gtest.h>
#include <string.h>
#include <sys/stat.h>

#include <algorithm>
#include <filesystem>
#include <functional>
#include <map>
#include <optional>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include "ramdump/chain_format.h"
#include "tests/harness/chain_checks.h"
#include "tests/harness/fake_device.h"

namespace {

const char kArmed[] = "/data/vendor/ramdump/armed";
const char kNew[] = "/data/vendor/ramdump/new";
const char kOut[] = "/data/vendor/ramdump/out";
const char kReserved[] = "/data/vendor/ramdump/RAMDUMP_RESERVED";
const char kOutDir[] = "/data/vendor/ramdump/apq/00";
const char kOutput[] = "/data/vendor/ramdump/apq/00/RAMDUMP_OUTPUT";
const char kMessage[] = "/data/vendor/ramdump/apq/00/RAMDUMP_MSG.txt";
const char kKvdump[] = "/dev/__properties__/debug.kvo.kvdump";
const char kTrace[] = "/tmp/fault-trace";
const char kFstab[] = "/vendor/etc/fstab.rbtest";
std::string fstab_text;             // the mount table, put back after a row removes it
const uint32_t kArmedCount = 1100;  // blocks of kArmed: at least two runs
const uint32_t kCount = 64;         // blocks of the reserved file
const uint32_t kCrc = 0x5eed;
const char kMsgText[] = "watchdog timeout on cpu 3\n";

// Before every row: kArmed armed with kCrc, the feature enabled, and a stored dump.
struct Context {
  FakeDevice& device;
  std::vector<long> armed, reserved;  // the two chains' blocks
  RunResult result;
};

struct Case {
  const char* name;
  std::string fault;  // RB_FAULT
  std::vector<std::string> args;
  int status;
  std::optional<std::string> out;  // exact standard output, when given
  std::vector<std::string> log;    // records of the tool's log in this order; its only errors
  std::set<std::string> changed;   // every file that must, and alone may, change
  const char* written;             // the file whose blocks alone may be written raw, or null
  std::function<void(Context&)> tamper = nullptr, check = nullptr;
  const char* program = "reserveblocks";
};

std::string E(const std::string& message) { return "E reserveblocks: " + message + "\\n\n"; }
std::string I(const std::string& message) { return "I reserveblocks: " + message + "\\n\n"; }

// Whether the log holds the records in this order, and no error records but theirs.
bool log_matches(const std::string& log, const std::vector<std::string>& records) {
  long errors = 0;
  size_t at = 0;
  for (const std::string& record : records) {
    if ((at = log.find(record, at)) == std::string::npos) return false;
    at += record.size(), errors += record[0] == 'E';
  }
  for (at = 0; (at = log.find("E reserveblocks: ", at)) != std::string::npos; ++at) --errors;
  return errors == 0;
}

// Mode, size and (but for chain files, written behind the file system) a content hash of every
// regular file of the root but /proc and /usr.
std::map<std::string, std::string> snapshot(const FakeDevice& device) {
  namespace fs = std::filesystem;
  const std::string root = device.host_path("");
  std::map<std::string, std::string> files;
  for (auto it = fs::recursive_directory_iterator(root); it != fs::recursive_directory_iterator();
       ++it) {
    const std::string path = it->path().string().substr(root.size());
    if (path == "/proc" || path == "/usr") it.disable_recursion_pending();
    struct stat st;
    if (lstat(it->path().c_str(), &st) != 0 || !S_ISREG(st.st_mode) || path == kTrace ||
        path == "/dev/__log__") {
      continue;
    }
    files[path] = std::to_string(st.st_mode) + " " + std::to_string(st.st_size);
    if (path != kArmed && path != kNew && path != kReserved) {
      files[path] += " " + std::to_string(std::hash<std::string>()(read_host_file(it->path())));
    }
  }
  return files;
}

std::set<std::string> changed(const std::map<std::string, std::string>& before,
                              const std::map<std::string, std::string>& after) {
  std::vector<std::pair<std::string, std::string>> differ;
  std::set_symmetric_difference(before.begin(), before.end(), after.begin(), after.end(),
                                std::back_inserter(differ));
  std::set<std::string> paths;
  for (const auto& entry : differ) paths.insert(entry.first);
  return paths;
}

// The first raw write outside the file's blocks ("none" if it has none), or "".
std::string raw_writes(const FakeDevice& device, const char* file) {
  std::set<long> allowed;
  if (file != nullptr) {
    const std::vector<long> blocks = map_file(device, file, device.read_file(file).size() / 4096);
    allowed.insert(blocks.begin(), blocks.end());
  }
  const std::string text = device.read_file(kTrace);
  if (file != nullptr && text.empty()) return "none";
  std::istringstream trace(text);
  for (long offset, length; trace >> offset >> length;) {
    for (long block = offset / 4096; block <= (offset + length - 1) / 4096; ++block) {
      if (allowed.count(block) == 0) return std::to_string(offset) + "+" + std::to_string(length);
    }
  }
  return "";
}

// Points a chain's block at another block, with the CRC that makes the link look genuine.
void relink(FakeDevice& device, const std::vector<long>& chain, size_t index, uint32_t next) {
  uint32_t crc = kCrc;
  for (size_t i = 0; i < index; ++i) crc = chain_crc(crc, chain[i], chain[i + 1]);
  uint8_t header[CHAIN_BLOCK_HEADER_SIZE];
  encode_chain_block_header({CHAIN_BLOCK_MAGIC, next, 0, 1, chain_crc(crc, chain[index], next)},
                            header);
  device.write_raw(chain[index] * 4096ull, std::string(reinterpret_cast<char*>(header), 16));
}

std::vector<long> arm(FakeDevice& device, const std::string& path, uint32_t count) {
  EXPECT_EQ(device.run({"-i", "5eed", path}).status, 0) << device.log();
  return map_file(device, path, count);
}

void prepare(Context& c) {
  FakeDevice& d = c.device;
  for (const char* path : {kOut, kNew, kOutput, kMessage, kOutDir, "/data/vendor/ramdump/apq"}) {
    d.remove(path);
  }
  std::filesystem::remove_all(d.host_path("/dt"));
  if (!d.exists(kArmed)) d.write_file(kArmed, std::string(kArmedCount * 4096, '\x77'));
  c.armed = arm(d, kArmed, kArmedCount);
  d.write_file(kReserved, std::string(kCount * 4096, '\xFF'), 0744);
  c.reserved = arm(d, kReserved, kCount);
  d.write_file("/data/vendor/ramdump/RAMDUMP_STATUS", "", 0666);
  set_misc_item(d, 3136, "LBA!");
  set_misc_item(d, 3184, make_ibh(c.reserved[0], 4096, kCount, kCrc, 1));
  set_misc_item(d, 3216, "????");  // neither flag value: counts as enabled
  d.set_property("debug.kvo.kvdump", "");
  d.set_property("debug.kvo.ramdump_new_directory", "");
  d.write_file("/tmp/RAMDUMP_MSG.txt", kMsgText);
  d.write_file("/tmp/memory0.bin", std::string(9000, '\x22'));
  RunResult r = d.run({MISC_DEVICE, USERDATA_DEVICE, "/tmp/memory0.bin", "/tmp/RAMDUMP_MSG.txt"},
                      "firmware_sim");
  EXPECT_EQ(r.status, 0) << r.err;
  d.clear_log();
}

std::vector<Case> cases() {
  const std::string eintr_reads = "read.dev=EINTR%2,lseek.dev=EINTR%2";
  const char* zeros = USERDATA_DEVICE "\n0x00000000\n0x0\n0x0\n0x0\n0x00000000\n0x00000000\n";
  const std::string misc_gone = "Error: " MISC_DEVICE " open failed.\nError: open partition failed";
  const std::set<std::string> boot = {MISC_DEVICE, kKvdump};
  const std::set<std::string> collected = {MISC_DEVICE, kKvdump,
                                           "/dev/__properties__/debug.kvo.ramdump_new_directory",
                                           kOutput, kMessage};
  auto loop = [](Context& c) { relink(c.device, c.reserved, 5, c.reserved[2]); };
  auto cut_dev = [](Context& c) {  // a device-tree mount table whose dev value lacks its NUL
    const std::string nul(1, '\0');
    c.device.write_file("/dt/compatible", "android,firmware" + nul);
    c.device.write_file("/dt/fstab/compatible", "android,fstab" + nul);
    c.device.write_file("/dt/fstab/data/dev", USERDATA_DEVICE);
    c.device.write_file("/dt/fstab/data/type", "ext4" + nul);
    c.device.write_file("/dt/fstab/data/mnt_flags", "noatime" + nul);
    c.device.write_file("/dt/fstab/data/fsmgr_flags", "wait" + nul);
  };
  // clang-format off
  return {
    {"EINTR on reads and seeks of the device: read-out unchanged", eintr_reads,
     {"-r", kOut, kArmed}, 0, zeros, {I("Opened " USERDATA_DEVICE " for reading"), I("Success")},
     {kOut}, nullptr, nullptr,
     [](Context& c) { EXPECT_EQ(c.device.read_file(kOut), raw_blocks(c.device, c.armed)); }},
    {"short and interrupted writes: creation and arming continue",
     "write.data=EINTR%2,write.data=short,write.dev=short", {"-i", "77", "-c", "300000", kNew}, 0,
     std::nullopt, {I("Success")}, {kNew}, kNew, nullptr,
     [](Context& c) {
       EXPECT_EQ(c.device.read_file(kNew).size(), 300000u);
       EXPECT_EQ(verify_chain(c.device, map_file(c.device, kNew, 73), 0x77, true), "");
     }},
    {"EIO on the second run's write: logged, arming still succeeds", "write.dev=EIO#2",
     {"-i", "abc", kArmed}, 0, std::nullopt, {E("error writing: Input/output error"), I("Success")},
     {}, kArmed, nullptr,
     [](Context& c) {
       // The first run carries the new chain, the second still the old one.
       size_t second = 1;
       while (second < MAX_RUN_BLOCKS && c.armed[second] == c.armed[second - 1] + 1) ++second;
       EXPECT_EQ(verify_chain(c.device, c.armed, 0xabc, true)
                     .rfind("chain block " + std::to_string(second) + " (", 0), 0u);
     }},
    {"FIBMAP fails for logical block 0: arming refuses block 0", "fibmap=EINVAL@0", {kArmed}, 255,
     "", {E("refusing to write to block 0")}, {}, nullptr},
    {"FIBMAP fails for logical block 0: the integrity test reads nothing", "fibmap=EINVAL@0",
     {"-t", kArmed}, 0, "",
     {E(std::string("Failed to get block 0 for file ") + kArmed + ": Invalid argument"),
      I(" block size: 4096 bytes"), I("Opened " USERDATA_DEVICE " for reading"),
      I("Read 0 blocks successfully")}, {}, nullptr},
    {"EIO writing the read-out: it stops", "write.data=EIO#1", {"-r", kOut, kArmed}, 255,
     std::nullopt, {E("error writing: Input/output error")}, {kOut}, nullptr},
    {"EIO reading the device: the read-out stops", "read.dev=EIO+2", {"-r", kOut, kArmed}, 255,
     std::nullopt, {E("error reading: Input/output error")}, {kOut}, nullptr},
    {"FIBMAP fails for logical block 5: read-out stops there", "fibmap=EINVAL@5",
     {"-r", kOut, kArmed}, 255, "", {E("failed to find block 5")}, {kOut}, nullptr, nullptr,
     [](Context& c) { EXPECT_EQ(c.device.read_file(kOut), raw_blocks(c.device, {c.armed.begin(), c.armed.begin() + 5})); }},
    {"misc gone after the enable flag was written", "fopen.misc=ENOENT+3", {"-e"}, 0,
     misc_gone + ", item=3\nRamdump disabled\n",
     {E("error reading ramdump enable flag from MISC partition")}, {MISC_DEVICE}, nullptr, nullptr,
     [](Context& c) { EXPECT_EQ(c.device.misc_bytes().substr(3216, 4), "EnAb"); }},
    {"next_block past the device's end: integrity test", "", {"-t", "-i", "5eed", kArmed}, 255, "",
     {E("error seeking to block fffffff0: Invalid argument")}, {}, nullptr,
     [](Context& c) { relink(c.device, c.armed, 3, 0xfffffff0u); }},
    {"looping chain: firmware refuses", "", {MISC_DEVICE, USERDATA_DEVICE, "/tmp/memory0.bin"}, 1,
     "", {}, {}, nullptr, loop,
     [](Context& c) { EXPECT_NE(c.result.err.find("(chain block 6)"), std::string::npos); },
     "firmware_sim"},
    {"device-tree dev value without its NUL: the cut name is no device", "", {kArmed}, 255, "",
     {I("  block dev: /dev/block/bootdevice/by-name/userdat"),
      E("failed to open blk_dev for writing: No such file or directory")}, {}, nullptr, cut_dev},
    {"the same for a read-out: nothing created", "", {"-r", kOut, kArmed}, 255, std::nullopt,
     {E("failed to open blk_dev:/dev/block/bootdevice/by-name/userdat for reading: No such file "
        "or directory")}, {}, nullptr, cut_dev},
    {"ENOSPC while creating the reserved file at boot", "write.data=ENOSPC#2", {"-a"}, 255, "",
     {I("Creating reserved area 4429185024 bytes"), E("error writing: No space left on device")},
     {MISC_DEVICE, kKvdump, kReserved}, nullptr,
     [](Context& c) { c.device.remove(kReserved); },
     [](Context& c) { EXPECT_EQ(c.device.read_file(kReserved).size(), 65536u); }},
    {"no mount table at boot: no block device, result 1", "", {"-a"}, 1, "",
     {E("failed to read default fstab")}, boot, nullptr,
     [](Context& c) { c.device.remove(kFstab); },
     [](Context& c) { c.device.write_file(kFstab, fstab_text); }},
    {"misc gone while a disable request is applied at boot", "fopen.misc=ENOENT+3", {"-a"}, 255,
     misc_gone + ", item=2.\n",
     {E("error writing ramdump disable initial block header to MISC partition"), E("Failed to disable ramdump")},
     {MISC_DEVICE}, nullptr,
     [](Context& c) { c.device.write_file("/data/vendor/ramdump/RAMDUMP_STATUS", "disable"); }},
    {"FIBMAP fails at boot: nothing read out, nothing stored", "fibmap=EINVAL@0", {"-a"}, 255, "",
     {E(std::string("Failed to get block 0 for file ") + kReserved + "; Invalid argument")}, boot,
     nullptr},
    {"misc gone before the header is read at boot", "fopen.misc=ENOENT+4", {"-a"}, 255,
     misc_gone + ", item=2\n", {E("Failed to read initial block header from MISC partition")},
     boot, nullptr},
    {"the lock cannot be taken at boot", "flock=EINVAL+1", {"-a"}, 255, "",
     {E("Could not lock /data/vendor/ramdump: Invalid argument")}, {kKvdump}, nullptr},
    {"the same for enable full: its status stays 0", "flock=EINVAL+1", {"enable", "full"}, 0, "",
     {E("Could not lock /data/vendor/ramdump: Invalid argument")}, {kKvdump}, nullptr},
    {"misc gone for the block address item at boot: the cycle goes on", "fopen.misc=ENOENT#2",
     {"-a"}, 0, misc_gone + ", item=1.\n",
     {E("error writing ramdump disable lba to MISC partition"),
      I("Found file 'RAMDUMP_MSG.txt', size 26"), E("* bad magic, got 00000000, expecting 654c3146")},
     collected, kReserved},
    {"misc gone for the header stored after re-arming", "fopen.misc=ENOENT#6", {"-a"}, 0,
     misc_gone + ", item=2.\n",
     {I("Found file 'RAMDUMP_MSG.txt', size 26"), E("* bad magic, got 00000000, expecting 654c3146"),
      E("Failed to write new initial block header to MISC partition")},
     collected, kReserved},
    {"looping chain at boot: read out and re-armed", "", {"-a"}, 0, "",
     {I("Found file 'RAMDUMP_MSG.txt', size 26"), E("* bad magic, got 00000000, expecting 654c3146")},
     collected, kReserved, loop,
     [](Context& c) {
       EXPECT_EQ(c.device.read_file(kMessage), kMsgText);
       EXPECT_EQ(verify_chain(c.device, c.reserved, kCrc, true), "");
     }},
    {"hostile record names and a 2^64-1 size: only the message file is written", "", {"-a"}, 0, "",
     {I("Found file 'RAMDUMP_MSG.txt', size 6")}, collected, kReserved,
     [](Context& c) {
       const std::string stream =
           dump_record("../../../../etc/pwn", 10, "0123456789") +
           dump_record("RAMDUMP_MSG.txt/../x", 5, "AAAAA") +  // 20 bytes, no terminator
           dump_record("/RAMDUMP_MSG.txt", 3, "BBB") + dump_record("..", 2, "CC") +
           dump_record("RAMDUMP_MSG.txt", 6, "hello\n") +
           dump_record("../RAMDUMP_MSG.txt", UINT64_MAX, std::string(5000, 'Z'));
       for (size_t k = 0; k * 4080 < stream.size(); ++k) {
         c.device.write_raw(c.reserved[k] * 4096ull + 16, stream.substr(k * 4080, 4080));
       }
     },
     [](Context& c) { EXPECT_EQ(c.device.read_file(kMessage), "hello\n"); }},
  };
  // clang-format on
}

TEST(FaultInjection, EveryCase) {
  std::string why;
  if (!fake_device_supported(&why)) GTEST_SKIP() << why;
  if (getenv("RB_TEST_WRAPPER") != nullptr && getenv("RB_TEST_WRAPPER")[0] != '\0') {
    GTEST_SKIP() << "the interposer is preloaded into native programs, not under an emulator";
  }
  FakeDeviceConfig config;
  config.data_bytes = 16ull << 30;  // the boot entry wants 10 GiB free to create the file
  config.cmdline = "console=ttyS0 androidboot.hardware=rbtest androidboot.android_dt_dir=/dt\n";
  FakeDevice d(config);
  ASSERT_EQ(d.setup_error(), "");
  fstab_text = d.read_file(kFstab);
  d.write_file("/system/lib/libfault_inject.so", read_host_file(RB_FAULT_LIBRARY), 0755);
  // faulted RULES PROGRAM ARGS...: runs the program with the interposer preloaded (a sanitizer
  // build wants its runtime first; the interposer only forwards to it).
  d.write_file("/system/bin/faulted",
               "#!/bin/sh\nexport RB_FAULT=\"$1\" RB_FAULT_TRACE=/tmp/fault-trace "
               "LD_PRELOAD=/system/lib/libfault_inject.so "
               "ASAN_OPTIONS=detect_leaks=0:verify_asan_link_order=0\n"
               "program=$2\nshift 2\nexec \"/system/bin/$program\" \"$@\"\n",
               0755);
  for (const Case& c : cases()) {
    SCOPED_TRACE(c.name);
    Context ctx{d, {}, {}, {}};
    prepare(ctx);
    if (c.tamper) c.tamper(ctx);
    const auto before = snapshot(d);
    d.remove(kTrace);
    std::vector<std::string> args = {c.fault, c.program};
    args.insert(args.end(), c.args.begin(), c.args.end());
    ctx.result = d.run(args, "faulted", 60);
    const std::string log = tool_log(d);
    ASSERT_FALSE(ctx.result.timed_out);  // no path may loop
    EXPECT_EQ(ctx.result.status, c.status) << ctx.result.err << log;
    EXPECT_EQ(ctx.result.err.find("fault_inject: ") != std::string::npos, !c.fault.empty());
    EXPECT_EQ(ctx.result.out, c.out.value_or(ctx.result.out));
    EXPECT_TRUE(log_matches(log, c.log)) << log;
    // A boot publishes its outcome; the stored header is re-armed after a read-out, else kept.
    const bool collected = c.args[0] == "-a" && c.status == 0;
    EXPECT_EQ(stored_ibh(d), make_ibh(ctx.reserved[0], 4096, kCount, kCrc, collected ? 1 : 3));
    if (c.changed.count(kKvdump) != 0) {
      EXPECT_EQ(d.property("debug.kvo.kvdump"), collected ? "done" : "fail");
      EXPECT_EQ(d.property("debug.kvo.ramdump_new_directory"), collected ? kOutDir : "");
    }
    EXPECT_EQ(changed(before, snapshot(d)), c.changed);
    EXPECT_EQ(raw_writes(d, c.written), "");
    if (c.check) c.check(ctx);
  }
}

}  // namespace
