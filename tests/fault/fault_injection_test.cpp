// Failing system calls and hostile on-disk data, run against the real binaries in the fake
// device root. The calls are broken by the preloaded fault_inject library (see fault_inject.c),
// which also records every write that reaches the raw device. Each case checks the exit status,
// standard output, the tool's log, and that the files which changed (anywhere in the root) and
// the raw device blocks written are exactly the ones the case allows.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <functional>
#include <map>
#include <memory>
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
const char kStatus[] = "/data/vendor/ramdump/RAMDUMP_STATUS";
const char kFstab[] = "/vendor/etc/fstab.rbtest";
const char kOutDir[] = "/data/vendor/ramdump/apq/00";
const char kOutput[] = "/data/vendor/ramdump/apq/00/RAMDUMP_OUTPUT";
const char kMessage[] = "/data/vendor/ramdump/apq/00/RAMDUMP_MSG.txt";
const char kKvdump[] = "/dev/__properties__/debug.kvo.kvdump";
const char kNewDirProp[] = "/dev/__properties__/debug.kvo.ramdump_new_directory";
const char kTrace[] = "/tmp/fault-trace";
const char kLibrary[] = "/system/lib/libfault_inject.so";
const uint32_t kCount = 64;  // blocks of every chain prepared here
const uint32_t kCrc = 0x5eed;
const char kMsgText[] = "watchdog bite on cpu 3\n";

// What the device holds before a case runs.
enum class State {
  kArmedFile,   // small /data: kArmed (short runs) armed with kCrc, its header in misc
  kNoReserved,  // large /data, feature enabled, no reserved file
  kStoredDump,  // large /data: a reserved file armed with kCrc holding a firmware dump (state 3)
};

// Damage done after the state is prepared.
enum class Tamper {
  kNone,
  kNextOutside,    // chain block 3 links to block 0xfffffff0, far past the device's end
  kLoop,           // chain block 5 links back to chain block 2
  kHostileStream,  // the dump stream's record names climb out of the directory; a huge size
  kDtDevNoNul,     // a device-tree mount table whose "dev" value lacks the final NUL
};

struct Context {
  FakeDevice& device;
  std::vector<long> chain;  // physical blocks of the state's chain file
  RunResult result;
  std::string log;
};

struct Case {
  const char* name;
  State state;
  Tamper tamper;
  std::string fault;  // RB_FAULT
  std::vector<std::string> args;
  std::string program;
  int status;
  std::string out;                // exact standard output; "{first}" is the written file's block 0
  std::vector<std::string> log;   // records expected in the tool's log, in this order
  std::set<std::string> changed;  // every path in the root that must (and alone may) change
  const char* written;            // the file whose blocks alone may be written raw, or null
  std::function<void(Context&)> check;
};

std::string le32(uint32_t v) {
  std::string s(4, '\0');
  for (int i = 0; i < 4; ++i) s[i] = static_cast<char>(v >> (8 * i));
  return s;
}

std::string hex(uint32_t v, bool padded) {
  char buf[16];
  snprintf(buf, sizeof(buf), padded ? "0x%08x" : "0x%x", v);
  return buf;
}

std::string header_lines(uint32_t block_size, const std::string& first, uint32_t count,
                         uint32_t crc, uint32_t state) {
  const uint32_t magic = block_size != 0 ? INITIAL_BLOCK_HEADER_MAGIC : 0;
  return std::string(USERDATA_DEVICE) + "\n" + hex(magic, true) + "\n" + hex(block_size, false) +
         "\n" + first + "\n" + hex(count, false) + "\n" + hex(crc, true) + "\n" + hex(state, true) +
         "\n";
}

bool in_order(const std::string& log, const std::vector<std::string>& records) {
  size_t at = 0;
  for (const std::string& record : records) {
    at = log.find(record, at);
    if (at == std::string::npos) return false;
    at += record.size();
  }
  return true;
}

size_t count_of(const std::string& text, const std::string& what) {
  size_t n = 0;
  for (size_t at = text.find(what); at != std::string::npos; at = text.find(what, at + 1)) ++n;
  return n;
}

// Every directory and regular file of the root (not /proc, /usr or the log), with its mode and
// size, and its content for files the tool writes through the file system. The chain files get
// raw writes behind the file system's back, so their cached content says nothing.
std::map<std::string, std::string> snapshot(const FakeDevice& device) {
  namespace fs = std::filesystem;
  const std::string root = device.host_path("");
  std::map<std::string, std::string> files;
  auto it = fs::recursive_directory_iterator(root);
  for (; it != fs::recursive_directory_iterator(); ++it) {
    const std::string path = it->path().string().substr(root.size());
    if (path == "/proc" || path == "/usr" || path == "/dev/__log__" || path == kTrace) {
      if (it->is_directory()) it.disable_recursion_pending();
      continue;
    }
    struct stat st;
    if (lstat(it->path().c_str(), &st) != 0) continue;
    std::string entry = std::to_string(st.st_mode);
    if (S_ISREG(st.st_mode)) entry += " " + std::to_string(st.st_size);
    if (S_ISREG(st.st_mode) && path != kArmed && path != kNew && path != kReserved) {
      entry += " " + std::to_string(std::hash<std::string>()(read_host_file(it->path())));
    }
    if (S_ISDIR(st.st_mode) || S_ISREG(st.st_mode)) files[path] = entry;
  }
  return files;
}

std::set<std::string> differences(const std::map<std::string, std::string>& a,
                                  const std::map<std::string, std::string>& b) {
  std::set<std::string> changed;
  for (const auto& [path, entry] : a) {
    auto other = b.find(path);
    if (other == b.end() || other->second != entry) changed.insert(path);
  }
  for (const auto& entry : b) {
    if (a.count(entry.first) == 0) changed.insert(entry.first);
  }
  return changed;
}

// "" when every raw write recorded by the interposer lies inside the blocks; otherwise the
// first one that does not.
std::string writes_outside(const FakeDevice& device, const std::vector<long>& blocks) {
  std::set<uint64_t> allowed(blocks.begin(), blocks.end());
  std::istringstream trace(device.read_file(kTrace));
  uint64_t offset;
  uint64_t length;
  while (trace >> offset >> length) {
    for (uint64_t block = offset / 4096; block <= (offset + length - 1) / 4096; ++block) {
      if (allowed.count(block) == 0) return std::to_string(offset) + "+" + std::to_string(length);
    }
  }
  return "";
}

// Points a chain block at another block, with the CRC that makes the link look genuine.
void relink(FakeDevice& device, const std::vector<long>& blocks, uint32_t crc, size_t index,
            uint32_t next) {
  for (size_t i = 0; i < index; ++i) {
    crc = chain_crc(crc, static_cast<uint32_t>(blocks[i]), static_cast<uint32_t>(blocks[i + 1]));
  }
  crc = chain_crc(crc, static_cast<uint32_t>(blocks[index]), next);
  const uint64_t offset = static_cast<uint64_t>(blocks[index]) * 4096;
  device.write_raw(offset + 4, le32(next));
  device.write_raw(offset + 12, le32(crc));
}

std::string dump_record(const std::string& name, uint64_t size, const std::string& content) {
  std::string field = name.substr(0, 20);
  field.resize(20, '\0');
  return "F1Le" + field + le32(static_cast<uint32_t>(size)) +
         le32(static_cast<uint32_t>(size >> 32)) + std::string(8, '\0') + content;
}

void set_misc_item(FakeDevice& device, size_t offset, const std::string& bytes) {
  std::string misc = device.misc_bytes();
  misc.replace(offset, bytes.size(), bytes);
  write_host_file(device.misc_host_path(), misc);
}

// A file of kCount blocks whose blocks alternate with another file's, four at a time, so that
// its chain has many runs.
void grow_fragmented(FakeDevice& device, const std::string& path) {
  const off_t step = 4 * 4096;
  int a = open(device.host_path(path).c_str(), O_RDWR | O_CREAT | O_TRUNC, 0644);
  int b = open(device.host_path(path + ".filler").c_str(), O_RDWR | O_CREAT | O_TRUNC, 0644);
  for (off_t at = 0; at < kCount * 4096; at += step) {
    ASSERT_EQ(posix_fallocate(a, at, step), 0);
    ASSERT_EQ(posix_fallocate(b, at, step), 0);
  }
  const std::string data(kCount * 4096, '\x77');
  for (int fd : {a, b}) {
    ASSERT_EQ(pwrite(fd, data.data(), data.size(), 0), static_cast<ssize_t>(data.size()));
    fsync(fd);
    close(fd);
  }
}

// Arms path with kCrc through the tool itself (no faults) and returns its blocks.
std::vector<long> arm(FakeDevice& device, const std::string& path) {
  RunResult r = device.run({"-i", "5eed", path});
  EXPECT_EQ(r.status, 0) << device.log();
  return map_file(device, path, kCount);
}

std::vector<long> prepare(FakeDevice& device, State state) {
  for (const char* path : {kOut, kNew, kOutput, kMessage, kOutDir, "/data/vendor/ramdump/apq"}) {
    device.remove(path);
  }
  std::filesystem::remove_all(device.host_path("/dt"));
  std::vector<long> chain;
  if (state == State::kArmedFile) {
    if (!device.exists(kArmed)) grow_fragmented(device, kArmed);
    chain = arm(device, kArmed);
    set_misc_item(device, 3184, make_ibh(chain[0], 4096, kCount, kCrc, 1));
    set_misc_item(device, 3216, "????");  // neither flag value: counts as enabled
  } else {
    device.remove(kReserved);
    device.write_file(kStatus, "", 0666);
    set_misc_item(device, 3216, "EnAb");
    set_misc_item(device, 3136, "LBA!");
    set_misc_item(device, 3184, std::string(24, '\x44'));
    device.set_property("debug.kvo.kvdump", "");
    device.set_property("debug.kvo.ramdump_new_directory", "");
    if (state == State::kStoredDump) {
      device.write_file(kReserved, std::string(kCount * 4096, '\xFF'), 0744);
      chain = arm(device, kReserved);
      set_misc_item(device, 3184, make_ibh(chain[0], 4096, kCount, kCrc, 1));
      device.write_file("/tmp/RAMDUMP_MSG.txt", kMsgText);
      device.write_file("/tmp/ddr.bin", std::string(9000, '\x22'));
      RunResult r = device.run(
          {MISC_DEVICE, USERDATA_DEVICE, "/tmp/ddr.bin", "/tmp/RAMDUMP_MSG.txt"}, "firmware_sim");
      EXPECT_EQ(r.status, 0) << r.err;
    }
  }
  device.clear_log();
  return chain;
}

void tamper(FakeDevice& device, Tamper how, const std::vector<long>& chain) {
  switch (how) {
    case Tamper::kNone:
      break;
    case Tamper::kNextOutside:
      relink(device, chain, kCrc, 3, 0xfffffff0u);
      break;
    case Tamper::kLoop:
      relink(device, chain, kCrc, 5, static_cast<uint32_t>(chain[2]));
      break;
    case Tamper::kHostileStream: {
      const std::string stream =
          dump_record("../../../../etc/pwn", 10, "0123456789") +
          dump_record("RAMDUMP_MSG.txt/../x", 5, "AAAAA") +  // 20 bytes, no terminator
          dump_record("/RAMDUMP_MSG.txt", 3, "BBB") + dump_record("..", 2, "CC") +
          dump_record("RAMDUMP_MSG.txt", 6, "hello\n") +
          dump_record("../RAMDUMP_MSG.txt", UINT64_MAX, std::string(5000, 'Z'));
      for (size_t k = 0; k * 4080 < stream.size(); ++k) {
        device.write_raw(static_cast<uint64_t>(chain[k]) * 4096 + 16,
                         stream.substr(k * 4080, 4080));
      }
      set_misc_item(device, 3184, make_ibh(chain[0], 4096, kCount, kCrc, 3));
      break;
    }
    case Tamper::kDtDevNoNul:
      device.write_file("/dt/compatible", std::string("android,firmware", 17));
      device.write_file("/dt/fstab/compatible", std::string("android,fstab", 14));
      device.write_file("/dt/fstab/data/dev", USERDATA_DEVICE);
      device.write_file("/dt/fstab/data/type", std::string("ext4", 5));
      device.write_file("/dt/fstab/data/mnt_flags", std::string("noatime", 8));
      device.write_file("/dt/fstab/data/fsmgr_flags", std::string("wait", 5));
      break;
  }
}

RunResult run_faulted(FakeDevice& device, const Case& c) {
  device.remove(kTrace);
  return device.run_in_root(
      [&]() {
        std::vector<std::string> args = {c.program};
        args.insert(args.end(), c.args.begin(), c.args.end());
        std::vector<char*> argv;
        for (std::string& arg : args) argv.push_back(&arg[0]);
        argv.push_back(nullptr);
        setenv("LD_PRELOAD", kLibrary, 1);
        setenv("RB_FAULT", c.fault.c_str(), 1);
        setenv("RB_FAULT_TRACE", kTrace, 1);
        // A sanitizer build wants its runtime first; the interposer only forwards to it.
        setenv("ASAN_OPTIONS", "detect_leaks=0:verify_asan_link_order=0", 1);
        execv(("/system/bin/" + c.program).c_str(), argv.data());
        perror("execv");
        return 127;
      },
      60);  // no path may loop: a hang shows as a timeout
}

// The runs of a chain: the start index of each.
std::vector<size_t> run_starts(const std::vector<long>& blocks) {
  std::vector<size_t> starts = {0};
  for (size_t i = 1; i < blocks.size(); ++i) {
    if (blocks[i] != blocks[i - 1] + 1 || i - starts.back() == MAX_RUN_BLOCKS) starts.push_back(i);
  }
  return starts;
}

std::string raw_blocks(const FakeDevice& device, const std::vector<long>& blocks, size_t n) {
  std::string bytes;
  for (size_t i = 0; i < n; ++i) {
    bytes += device.read_raw(static_cast<uint64_t>(blocks[i]) * 4096, 4096);
  }
  return bytes;
}

// Log records as tool_log() shows them.
std::string error_line(const std::string& message) {
  return "E reserveblocks: " + message + "\\n\n";
}
std::string info_line(const std::string& message) {
  return "I reserveblocks: " + message + "\\n\n";
}

// One row per case: what is prepared and damaged, the fault, the command line, and what must
// come of it (see Case).
std::vector<Case> cases() {
  const std::string eintr_reads = "read.dev=EINTR%2,lseek.dev=EINTR%2";
  const std::string zeros = header_lines(0, "0x0", 0, 0, 0);
  const std::string armed_header = header_lines(4096, "{first}", kCount, 0xabc, 1);
  const std::string misc_gone = "Error: " MISC_DEVICE " open failed.\nError: open partition failed";
  const std::string no_block_0 = "Failed to get block 0 for file ";
  const std::set<std::string> boot = {MISC_DEVICE, kKvdump};
  const std::set<std::string> collected = {
      MISC_DEVICE, kKvdump, kNewDirProp, kOutput, kMessage, kOutDir, "/data/vendor/ramdump/apq"};
  auto no_errors = [](Context& c) { EXPECT_EQ(count_of(c.log, "E reserveblocks"), 0u) << c.log; };
  // clang-format off
  return {
    {"EINTR on reads and seeks of the device: read-out unchanged",
     State::kArmedFile, Tamper::kNone, eintr_reads, {"-r", kOut, kArmed}, "reserveblocks", 0, zeros,
     {info_line("Opened " USERDATA_DEVICE " for reading"), info_line("Success")}, {kOut}, nullptr,
     [=](Context& c) {
       EXPECT_EQ(c.device.read_file(kOut), raw_blocks(c.device, c.chain, kCount));
       no_errors(c);
     }},
    {"EINTR on reads and seeks of the device: integrity test unchanged",
     State::kArmedFile, Tamper::kNone, eintr_reads, {"-t", "-i", "5eed", kArmed}, "reserveblocks",
     0, "", {info_line("Read 64 blocks successfully")}, {}, nullptr, no_errors},
    {"EINTR on writes and seeks of the device: arming unchanged",
     State::kArmedFile, Tamper::kNone, "write.dev=EINTR%2,lseek.dev=EINTR%2", {"-i", "abc", kArmed},
     "reserveblocks", 0, armed_header, {info_line("Success")}, {}, kArmed,
     [=](Context& c) {
       EXPECT_EQ(verify_chain(c.device, c.chain, 0xabc, true), "");
       no_errors(c);
     }},
    {"short and interrupted writes: creation and arming continue",
     State::kArmedFile, Tamper::kNone, "write.data=EINTR%2,write.data=short,write.dev=short",
     {"-i", "77", "-c", "300000", kNew}, "reserveblocks", 0,
     header_lines(4096, "{first}", 73, 0x77, 1), {info_line("Success")}, {kNew}, kNew,
     [=](Context& c) {
       EXPECT_EQ(c.device.read_file(kNew).size(), 300000u);
       EXPECT_EQ(verify_chain(c.device, map_file(c.device, kNew, 73), 0x77, true), "");
       no_errors(c);
     }},
    {"ENOSPC while creating the block file",
     State::kArmedFile, Tamper::kNone, "write.data=ENOSPC#2", {"-c", "300000", kNew},
     "reserveblocks", 255, "",
     {info_line("Creating reserved area 300000 bytes"),
      error_line("error writing: No space left on device")}, {kNew}, nullptr,
     [](Context& c) {
       EXPECT_EQ(c.device.read_file(kNew), std::string(65536, '\xFF'));
       EXPECT_EQ(count_of(c.log, "reserveblocks:"), 2u) << c.log;
     }},
    {"EIO on the second run's write: logged, arming still succeeds",
     State::kArmedFile, Tamper::kNone, "write.dev=EIO#2", {"-i", "abc", kArmed}, "reserveblocks",
     0, armed_header, {error_line("error writing: Input/output error"), info_line("Success")}, {},
     kArmed,
     [](Context& c) {
       // The first run carries the new chain, the second still the old one.
       std::vector<size_t> runs = run_starts(c.chain);
       ASSERT_GE(runs.size(), 3u) << "the file system did not fragment the file";
       EXPECT_EQ(verify_chain(c.device, c.chain, 0xabc, true)
                     .rfind("chain block " + std::to_string(runs[1]) + " (", 0), 0u);
       EXPECT_EQ(count_of(c.log, "E reserveblocks"), 1u) << c.log;
     }},
    {"FIBMAP fails for logical block 0: arming refuses block 0",
     State::kArmedFile, Tamper::kNone, "fibmap=EINVAL@0", {kArmed}, "reserveblocks", 255, "",
     {error_line("refusing to write to block 0")}, {}, nullptr, nullptr},
    {"FIBMAP fails for logical block 5: arming names it",
     State::kArmedFile, Tamper::kNone, "fibmap=EINVAL@5", {kArmed}, "reserveblocks", 255, "",
     {error_line("failed to find block 5")}, {}, nullptr, nullptr},
    {"FIBMAP fails for logical block 0: the integrity test reads nothing",
     State::kArmedFile, Tamper::kNone, "fibmap=EINVAL@0", {"-t", kArmed}, "reserveblocks", 0, "",
     {error_line(no_block_0 + kArmed + ": Invalid argument"), info_line(" block size: 4096 bytes"),
      info_line("Opened " USERDATA_DEVICE " for reading"), info_line("Read 0 blocks successfully")},
     {}, nullptr, nullptr},
    {"FIBMAP fails for logical block 5: read-out stops there",
     State::kArmedFile, Tamper::kNone, "fibmap=EINVAL@5", {"-r", kOut, kArmed}, "reserveblocks",
     255, "", {error_line("failed to find block 5")}, {kOut}, nullptr,
     [](Context& c) { EXPECT_EQ(c.device.read_file(kOut), raw_blocks(c.device, c.chain, 5)); }},
    {"misc gone after the enable flag was written",
     State::kArmedFile, Tamper::kNone, "fopen.misc=ENOENT+3", {"-e"}, "reserveblocks", 0,
     misc_gone + ", item=3\nRamdump disabled\n",
     {error_line("error reading ramdump enable flag from MISC partition")}, {MISC_DEVICE}, nullptr,
     [](Context& c) { EXPECT_EQ(c.device.misc_bytes().substr(3216, 4), "EnAb"); }},
    {"misc gone after the header was cleared",
     State::kArmedFile, Tamper::kNone, "fopen.misc=ENOENT+3", {"-d"}, "reserveblocks", 1,
     misc_gone + ", item=3.\n",
     {error_line("error writing ramdump disable flag to MISC partition"),
      error_line("failed to disable ramdump")}, {MISC_DEVICE}, nullptr,
     [](Context& c) {
       EXPECT_EQ(stored_ibh(c.device), std::string(24, '\0'));
       EXPECT_EQ(c.device.misc_bytes().substr(3216, 4), "????");
     }},
    {"next_block past the device's end: integrity test",
     State::kArmedFile, Tamper::kNextOutside, "", {"-t", "-i", "5eed", kArmed}, "reserveblocks",
     255, "", {error_line("error seeking to block fffffff0: Invalid argument")}, {}, nullptr,
     [](Context& c) { EXPECT_EQ(count_of(c.log, "CRC32 mismatch"), 0u) << c.log; }},
    {"next_block past the device's end: firmware refuses",
     State::kArmedFile, Tamper::kNextOutside, "", {MISC_DEVICE, USERDATA_DEVICE, kFstab},
     "firmware_sim", 1, "", {}, {}, nullptr,
     [](Context& c) {
       EXPECT_NE(c.result.err.find("cannot read block 4294967280 (chain block 4)"),
                 std::string::npos) << c.result.err;
     }},
    {"looping chain: read-out follows the file, not the links",
     State::kArmedFile, Tamper::kLoop, "", {"-r", kOut, kArmed}, "reserveblocks", 0, zeros,
     {info_line("Success")}, {kOut}, nullptr,
     [](Context& c) {
       EXPECT_EQ(c.device.read_file(kOut), raw_blocks(c.device, c.chain, kCount));
     }},
    {"looping chain: firmware refuses",
     State::kArmedFile, Tamper::kLoop, "", {MISC_DEVICE, USERDATA_DEVICE, kFstab}, "firmware_sim",
     1, "", {}, {}, nullptr,
     [](Context& c) {
       EXPECT_NE(c.result.err.find("(chain block 6)"), std::string::npos) << c.result.err;
     }},
    {"device-tree dev value without its NUL: the cut name is no device",
     State::kArmedFile, Tamper::kDtDevNoNul, "", {kArmed}, "reserveblocks", 255, "",
     {info_line("  block dev: /dev/block/bootdevice/by-name/userdat"),
      error_line("failed to open blk_dev for writing: No such file or directory")}, {}, nullptr,
     nullptr},
    {"ENOSPC while creating the reserved file at boot",
     State::kNoReserved, Tamper::kNone, "write.data=ENOSPC#2", {"-a"}, "reserveblocks", 255, "",
     {info_line("Creating reserved area 4429185024 bytes"),
      error_line("error writing: No space left on device")},
     {MISC_DEVICE, kKvdump, kReserved}, nullptr,
     [](Context& c) {
       EXPECT_EQ(c.device.property("debug.kvo.kvdump"), "fail");
       EXPECT_EQ(stored_ibh(c.device), std::string(24, '\x44'));
       EXPECT_EQ(c.device.read_file(kReserved).size(), 65536u);
     }},
    {"FIBMAP fails at boot: nothing read out, nothing stored",
     State::kStoredDump, Tamper::kNone, "fibmap=EINVAL@0", {"-a"}, "reserveblocks", 255, "",
     {error_line(no_block_0 + kReserved + "; Invalid argument")}, boot, nullptr,
     [](Context& c) {
       EXPECT_EQ(stored_ibh(c.device), make_ibh(c.chain[0], 4096, kCount, kCrc, 3));
     }},
    {"misc gone before the header is read at boot",
     State::kStoredDump, Tamper::kNone, "fopen.misc=ENOENT+4", {"-a"}, "reserveblocks", 255,
     misc_gone + ", item=2\n",
     {error_line("Failed to read initial block header from MISC partition")}, boot, nullptr,
     [](Context& c) {
       EXPECT_EQ(stored_ibh(c.device), make_ibh(c.chain[0], 4096, kCount, kCrc, 3));
       EXPECT_EQ(c.device.property("debug.kvo.kvdump"), "fail");
     }},
    {"looping chain at boot: read out and re-armed",
     State::kStoredDump, Tamper::kLoop, "", {"-a"}, "reserveblocks", 0, "",
     {info_line("Found file 'RAMDUMP_MSG.txt', size 23")}, collected, kReserved,
     [](Context& c) {
       EXPECT_EQ(c.device.read_file(kMessage), kMsgText);
       EXPECT_EQ(verify_chain(c.device, c.chain, kCrc, true), "");
       EXPECT_EQ(stored_ibh(c.device), make_ibh(c.chain[0], 4096, kCount, kCrc, 1));
     }},
    {"hostile record names and a 2^64-1 size: only the message file is written",
     State::kStoredDump, Tamper::kHostileStream, "", {"-a"}, "reserveblocks", 0, "",
     {info_line("Found file 'RAMDUMP_MSG.txt', size 6")}, collected, kReserved,
     [](Context& c) {
       EXPECT_EQ(c.device.read_file(kMessage), "hello\n");
       EXPECT_EQ(count_of(c.log, "Found file"), 1u) << c.log;
     }},
  };
  // clang-format on
}

class FaultInjection : public testing::Test {
 protected:
  void SetUp() override {
    std::string why;
    if (!fake_device_supported(&why)) GTEST_SKIP() << why;
    const char* wrapper = getenv("RB_TEST_WRAPPER");
    if (wrapper != nullptr && wrapper[0] != '\0') {
      GTEST_SKIP() << "the interposer is preloaded into native programs, not under an emulator";
    }
  }

  FakeDevice& device(State state) {
    std::unique_ptr<FakeDevice>& d = state == State::kArmedFile ? small_ : large_;
    if (!d) {
      FakeDeviceConfig config;
      config.data_bytes = state == State::kArmedFile ? 64ull << 20 : 16ull << 30;
      config.cmdline =
          "console=ttyMSM0 androidboot.hardware=rbtest androidboot.android_dt_dir=/dt\n";
      d = std::make_unique<FakeDevice>(config);
      d->write_file(kLibrary, read_host_file(RB_FAULT_LIBRARY), 0755);
    }
    return *d;
  }

  std::unique_ptr<FakeDevice> small_;
  std::unique_ptr<FakeDevice> large_;
};

TEST_F(FaultInjection, EveryCase) {
  for (const Case& c : cases()) {
    SCOPED_TRACE(c.name);
    FakeDevice& d = device(c.state);
    ASSERT_EQ(d.setup_error(), "");
    std::vector<long> chain = prepare(d, c.state);
    tamper(d, c.tamper, chain);
    // Reading the files may update their access times; that reaches the device at the sync,
    // before the raw device is read.
    const auto before = snapshot(d);
    sync();
    const bool compare_raw =
        c.state == State::kArmedFile && c.written == nullptr &&
        std::none_of(c.changed.begin(), c.changed.end(),
                     [](const std::string& p) { return p.rfind("/data/", 0) == 0; });
    const std::string raw_before = compare_raw ? d.read_raw(0, 64u << 20) : "";

    Context ctx{d, chain, run_faulted(d, c), ""};
    ctx.log = tool_log(d);
    const RunResult& r = ctx.result;
    ASSERT_FALSE(r.timed_out);
    EXPECT_EQ(r.status, c.status) << r.err << ctx.log;
    std::vector<long> written;
    if (c.written != nullptr) written = map_file(d, c.written, c.written == kNew ? 73 : kCount);
    std::string out = c.out;
    size_t at = out.find("{first}");
    if (at != std::string::npos)
      out.replace(at, 7, hex(static_cast<uint32_t>(written.at(0)), false));
    EXPECT_EQ(r.out, out);
    EXPECT_TRUE(in_order(ctx.log, c.log)) << ctx.log;

    sync();
    // Nothing was created or written raw: the whole device must read as before.
    if (compare_raw) {
      EXPECT_TRUE(d.read_raw(0, 64u << 20) == raw_before);
    }
    EXPECT_EQ(differences(before, snapshot(d)), c.changed);
    EXPECT_EQ(writes_outside(d, written), "");
    if (c.check) c.check(ctx);
  }
}

}  // namespace
