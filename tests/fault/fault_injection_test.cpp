// Failing system calls (fault_inject.c, preloaded), hostile on-disk data and the boot-time runs
// of the real binaries in the fake device root: status, output, log, every change, raw reads and
// writes.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <filesystem>
#include <functional>
#include <map>
#include <optional>
#include <set>
#include <sstream>
#include <string>
#include <tuple>
#include <vector>

#include "ramdump/chain_format.h"
#include "tests/harness/chain_checks.h"
#include "tests/harness/fake_device.h"

namespace {

namespace fs = std::filesystem;
using Paths = std::set<std::string>;
using Snapshot = std::map<std::string, std::string>;
using Step = std::function<void(FakeDevice&)>;

const std::string kDir = "/data/vendor/ramdump", kArmed = kDir + "/armed", kNew = kDir + "/new",
                  kOut = kDir + "/out", kReserved = kDir + "/RAMDUMP_RESERVED",
                  kStatus = kDir + "/RAMDUMP_STATUS", kRdmp = kDir + "/kvdump.rdmp",
                  kApq = kDir + "/apq", kOutDir = kApq + "/00",
                  kOutput = kOutDir + "/RAMDUMP_OUTPUT", kMessage = kOutDir + "/RAMDUMP_MSG.txt",
                  kKvdump = "/dev/__properties__/debug.kvo.kvdump",
                  kNewDir = "/dev/__properties__/debug.kvo.ramdump_new_directory",
                  kTrace = "/tmp/fault-trace", kFstab = "/vendor/etc/fstab.rbtest",
                  kFiller = "/data/filler", kDt = "/dt", kMsgText = "watchdog timeout on cpu 3\n",
                  kLba = "misc block address", kIbh = "misc header", kFlag = "misc enable flag";
// The misc items that the snapshot keeps apart from the rest of the image: offset and size.
const std::tuple<std::string, size_t, size_t> kItems[] = {
    {kLba, 3136, 4}, {kIbh, 3184, 24}, {kFlag, 3216, 4}};
const uint32_t kArmedCount = 1100, kCount = 64, kCrc = 0x5eed;   // kArmed has two runs
const uint64_t kCreate = 10737418240ull, kKeep = 6442450944ull;  // free space thresholds

std::vector<long> armed, reserved;  // the two chains' blocks
std::string ibh;                    // the header a re-arming stores
RunResult result;                   // the row's run

struct Case {
  const char* name;
  std::string fault;  // RB_FAULT
  std::vector<std::string> args;
  int status;
  std::optional<std::string> out;  // exact standard output, when given
  std::vector<std::string> log;    // records of the tool's log in this order; its only errors
  Paths changed;  // every file, directory, misc item or property that must, and alone may, change
  Step tamper = nullptr, check = nullptr;
  std::string written = "";  // the file whose blocks alone may be written raw
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

// The mode of everything in the root but /proc, /usr and the filler, and of a regular file its
// size and (but for chain files, written behind the file system) a hash of its content; the
// misc items by their bytes.
Snapshot snapshot(const FakeDevice& device) {
  const std::string root = device.host_path("");
  Snapshot files;
  for (auto it = fs::recursive_directory_iterator(root); it != fs::recursive_directory_iterator();
       ++it) {
    const std::string path = it->path().string().substr(root.size());
    if (path == "/proc" || path == "/usr" || path == kFiller) it.disable_recursion_pending();
    struct stat st;
    if (lstat(it->path().c_str(), &st) != 0 || path == kTrace || path == "/dev/__log__") continue;
    std::string& entry = files[path] = std::to_string(st.st_mode);
    if (!S_ISREG(st.st_mode)) continue;
    entry += " " + std::to_string(st.st_size);
    if (path == kArmed || path == kNew || path == kReserved) continue;
    std::string content = read_host_file(it->path());
    for (const auto& [item, at, size] : kItems) {
      if (path == MISC_DEVICE) files[item] = content.substr(at, size);
      if (path == MISC_DEVICE) content.replace(at, size, size, '\0');
    }
    entry += " " + std::to_string(std::hash<std::string>()(content));
  }
  return files;
}

Paths changed(const Snapshot& before, const Snapshot& after) {
  std::vector<std::pair<std::string, std::string>> differ;
  std::set_symmetric_difference(before.begin(), before.end(), after.begin(), after.end(),
                                std::back_inserter(differ));
  Paths paths;
  for (const auto& entry : differ) paths.insert(entry.first);
  return paths;
}

// The traced transfers of a block device of one kind ('r', 'w') as "offset length" lines.
std::string traced(const FakeDevice& device, char kind) {
  std::istringstream in(device.read_file(kTrace));
  std::string lines;
  for (std::string line; std::getline(in, line);) {
    if (line[0] == kind) lines += line.substr(2) + "\n";
  }
  return lines;
}

// The first raw write outside the file's blocks ("none" if it has none), or "".
std::string raw_writes(const FakeDevice& device, const std::string& file) {
  const std::string text = traced(device, 'w');
  if (!file.empty() && text.empty()) return "none";
  const std::vector<long> blocks =
      file.empty() ? std::vector<long>()
                   : map_file(device, file, device.read_file(file).size() / 4096);
  const std::set<long> allowed(blocks.begin(), blocks.end());
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

// Before every row: no device tree, the request file empty and private, the block address item
// set, the feature enabled (a flag that is neither value), the previous boot's dump collected.
// Before a boot-time run or the firmware, also the reserved file armed with kCrc and a dump
// stored in it; its header's state lacks the armed bit and has another (6): the dump bit counts.
void prepare(FakeDevice& d, bool boot) {
  for (const std::string& path : {kOut, kNew, kFiller, kDt}) fs::remove_all(d.host_path(path));
  fs::create_directories(d.host_path(kOutDir));
  for (const std::string& dir : {kApq, kOutDir}) fs::permissions(d.host_path(dir), fs::perms::all);
  for (const std::string& path : {kOutput, kMessage}) d.write_file(path, "old", 0666);
  d.write_file(kRdmp, "", 0666);  // empty: its deletion frees no space
  d.write_file(kStatus, "", 0600);
  for (const std::string& property : {kKvdump, kNewDir}) d.write_file(property, "");
  set_misc_item(d, 3136, "LBA!");
  set_misc_item(d, 3216, "????");
  if (boot) {
    d.write_file(kReserved, std::string(kCount * 4096, '\xFF'), 0744);
    reserved = arm(d, kReserved, kCount);
    set_misc_item(d, 3184, make_ibh(reserved[0], 4096, kCount, kCrc, 4));
    ibh = make_ibh(reserved[0], 4096, kCount, kCrc, 1);
    RunResult r = d.run({MISC_DEVICE, USERDATA_DEVICE, "/tmp/memory0.bin", "/tmp/RAMDUMP_MSG.txt"},
                        "firmware_sim");
    EXPECT_EQ(r.status, 0) << r.err;
  }
  d.clear_log();
}

std::vector<Case> cases() {
  const char* zeros = USERDATA_DEVICE "\n0x00000000\n0x0\n0x0\n0x0\n0x00000000\n0x00000000\n";
  const std::string misc_gone = "Error: " MISC_DEVICE " open failed.\nError: open partition failed",
                    lock = E("Could not lock /data/vendor/ramdump: Invalid argument"),
                    found = I("Found file 'RAMDUMP_MSG.txt', size 26"),
                    bad_magic = E("* bad magic, got 00000000, expecting 654c3146"),
                    near_miss = "E reserveblocks: failed to convert enabl",
                    short_of = "Not enough space available to create ramdump ",
                    deleting = "Ramdump is disabled, deleting ramdump ",
                    disabling = E("Disabling ramdump due to not enough free space");
  const auto with = [](Paths paths, const Paths& more) {
    paths.insert(more.begin(), more.end());
    return paths;
  };
  // A boot that ends before the header is read; one that reads a dump out, with and without
  // the block address item; one that disables the feature, and one that deletes the old dump.
  const Paths boot = {kLba, kRdmp, kKvdump}, read_out = {kIbh, kKvdump, kNewDir, kOutput, kMessage},
              collected = with(read_out, {kLba, kRdmp}), disabled = with(boot, {kIbh, kFlag}),
              deleted = with(boot, {kOutput, kMessage, kOutDir, kApq});
  const auto read_up_to = [](size_t n) -> Step {  // the read-out holds kArmed's first n blocks
    return [n](FakeDevice& d) {
      EXPECT_EQ(d.read_file(kOut), raw_blocks(d.data_device(), {armed.begin(), armed.begin() + n}));
    };
  };
  const auto space = [](uint64_t free) -> Step {
    return [free](FakeDevice& d) { ASSERT_TRUE(d.set_free_space(free)); };
  };
  const auto state = [](uint32_t stored, uint32_t rearmed) -> Step {  // of the stored header
    return [=](FakeDevice& d) {
      set_misc_item(d, 3184, make_ibh(reserved[0], 4096, kCount, kCrc, stored));
      ibh = make_ibh(reserved[0], 4096, kCount, kCrc, rearmed);
    };
  };
  const auto shell = [](const std::string& command) -> Step {  // $R: the root
    return [=](FakeDevice& d) {
      EXPECT_EQ(system(("R=" + d.host_path("") + " && " + command).c_str()), 0);
    };
  };
  const Step cut_dev = [](FakeDevice& d) {  // a device-tree mount table, its dev value cut short
    for (const std::string file :
         {"compatible=android,firmware", "fstab/compatible=android,fstab", "fstab/data/type=ext4",
          "fstab/data/mnt_flags=noatime", "fstab/data/fsmgr_flags=wait"}) {
      d.write_file("/dt/" + file.substr(0, file.find('=')), file.substr(file.find('=') + 1) + '\0');
    }
    d.write_file("/dt/fstab/data/dev", USERDATA_DEVICE);  // without its NUL
  };
  // clang-format off
  return {
    {"EINTR on reads and seeks of the device: read-out unchanged, each run read at once",
     "read.dev=EINTR%2,lseek.dev=EINTR%2", {"-r", kOut, kArmed}, 0, zeros,
     {I("Opened " USERDATA_DEVICE " for reading"), I("Success")}, {kOut}, nullptr,
     [=](FakeDevice& d) {
       read_up_to(kArmedCount)(d);
       EXPECT_EQ(traced(d, 'r'), std::to_string(armed[0] * 4096) + " 4194304\n" +
                                     std::to_string(armed[1024] * 4096) + " 311296\n");
     }},
    {"EIO on a run's read: the run is read again block by block", "read.dev=EIO#1",
     {"-r", kOut, kArmed}, 0, zeros, {I("Success")}, {kOut}, nullptr, read_up_to(kArmedCount)},
    {"short and interrupted writes: creation and arming go on",
     "write.data=EINTR%2,write.data=short,write.dev=short", {"-i", "77", "-c", "300000", kNew}, 0,
     std::nullopt, {I("Success")}, {kNew}, nullptr, [](FakeDevice& d) {
       EXPECT_EQ(d.read_file(kNew).size(), 300000u);
       EXPECT_EQ(verify_chain(d, map_file(d, kNew, 73), 0x77, true), "");
     }, kNew},
    {"next_block past the device's end: integrity test", "", {"-t", "-i", "5eed", kArmed}, 255, "",
     {E("error seeking to block fffffff0: Invalid argument")}, {},
     [](FakeDevice& d) { relink(d, armed, 3, 0xfffffff0u); }},
    {"EIO on the second run's write: logged, arming goes on; the second run keeps the old chain",
     "write.dev=EIO#2", {"-i", "abc", kArmed}, 0, std::nullopt,
     {E("error writing: Input/output error"), I("Success")}, {}, nullptr, [](FakeDevice& d) {
       EXPECT_EQ(verify_chain(d, armed, 0xabc, true).rfind("chain block 1024 (", 0), 0u);
     }, kArmed},
    {"the file cannot be opened once measured: no arming", "openat.data=ENOENT#1", {kArmed}, 255,
     "", {E("failed to open fd for reading: No such file or directory")}, {}},
    {"the same for a read-out: nothing written", "openat.data=ENOENT#1", {"-r", kOut, kArmed}, 255,
     "", {E("failed to open infile:" + kArmed + " for reading: No such file or directory")}, {}},
    {"FIBMAP fails for logical block 0: arming refuses block 0", "fibmap=EINVAL@0", {kArmed}, 255,
     "", {E("refusing to write to block 0")}, {}},
    {"FIBMAP fails for logical block 0: the integrity test reads nothing", "fibmap=EINVAL@0",
     {"-t", kArmed}, 0, "", {E("Failed to get block 0 for file " + kArmed + ": Invalid argument"),
      I(" block size: 4096 bytes"), I("Opened " USERDATA_DEVICE " for reading"),
      I("Read 0 blocks successfully")}, {}},
    {"EIO writing the read-out: it stops", "write.data=EIO#1", {"-r", kOut, kArmed}, 255,
     std::nullopt, {E("error writing: Input/output error")}, {kOut}},
    {"EIO reading the device: the read-out stops", "read.dev=EIO+2", {"-r", kOut, kArmed}, 255,
     std::nullopt, {E("error reading: Input/output error")}, {kOut}},
    {"FIBMAP fails inside the first run: read-out stops there", "fibmap=EINVAL@5",
     {"-r", kOut, kArmed}, 255, "", {E("failed to find block 5")}, {kOut}, nullptr, read_up_to(5)},
    {"FIBMAP fails for the second run's first block (the first 1024 blocks are one run)",
     "fibmap=EINVAL@1024", {"-r", kOut, kArmed}, 255, "", {E("failed to find block 1024")}, {kOut},
     [](FakeDevice&) { ASSERT_EQ(armed[1023], armed[0] + 1023); }, read_up_to(1024)},
    {"misc gone after the enable flag was written", "fopen.misc=ENOENT+3", {"-e"}, 0,
     misc_gone + ", item=3\nRamdump disabled\n",
     {E("error reading ramdump enable flag from MISC partition")}, {kFlag}},
    {"the lock cannot be taken for -e", "flock=EINVAL+1", {"-e"}, 1, "", {lock}, {}},
    {"enable fullx is no enable full", "", {"enable", "fullx"}, 1, "", {near_miss}, {}},
    {"nor is enable full x", "", {"enable", "full", "x"}, 1, "", {near_miss}, {}},
    {"nor enablex full", "", {"enablex", "full"}, 1, "", {near_miss}, {}},
    {"device-tree dev value without its NUL: the cut name is no device", "", {kArmed}, 255, "",
     {I("  block dev: /dev/block/bootdevice/by-name/userdat"),
      E("failed to open blk_dev for writing: No such file or directory")}, {}, cut_dev},
    {"the same for a read-out: nothing created", "", {"-r", kOut, kArmed}, 255, "",
     {E("failed to open blk_dev:/dev/block/bootdevice/by-name/userdat for reading: No such file "
        "or directory")}, {}, cut_dev},
    {"looping chain: firmware refuses", "", {MISC_DEVICE, USERDATA_DEVICE, "/tmp/memory0.bin"}, 1,
     "", {}, {}, [](FakeDevice& d) { relink(d, reserved, 5, reserved[2]); },
     [](FakeDevice&) { EXPECT_NE(result.err.find("(chain block 6)"), std::string::npos); }, "",
     "firmware_sim"},
    {"disabled, no request file, no reserved file: the request file made, the old dump deleted",
     "", {"-a"}, 255, "", {E("Failed to delete " + kReserved + ": No such file or directory")},
     with(deleted, {kStatus}),
     [](FakeDevice& d) { d.remove(kStatus), d.remove(kReserved), set_misc_item(d, 3216, "DiSa"); },
     [](FakeDevice& d) {
       EXPECT_EQ(fs::status(d.host_path(kStatus)).permissions(), fs::perms(0666));
     }},
    {"a disable request on its first line wins: all deleted", "", {"-a"}, 0, "",
     {I("Disabling ramdump"), I(deleting + "reserved file: " + kReserved),
      I(deleting + "output file: " + kOutput)}, with(deleted, {kIbh, kFlag, kReserved}),
     [](FakeDevice& d) { d.write_file(kStatus, "disable\nenable\n"); }},
    {"no ramdump directory at boot: no request file, no space, disabled", "", {"-a"}, 255, "",
     {E("Could not create file " + kStatus + ": No such file or directory"),
      E("Could not statvfs /data/vendor/ramdump: No such file or directory"),
      E(short_of + "reserved file: have 0 bytes, need 10737418240 bytes"), disabling},
     {kLba, kIbh, kFlag, kKvdump}, shell("mv $R" + kDir + " $R" + kDir + ".away"),
     shell("mv $R" + kDir + ".away $R" + kDir)},
    {"too little room to keep a dump: disabled, the reserved file kept", "", {"-a"}, 255, "",
     {E(short_of + "output file: have 6442446848 bytes, need 6442450944 bytes"), disabling},
     disabled, space(kKeep - 4096)},
    {"ENOSPC creating the reserved file at exactly 10 GiB free", "write.data=ENOSPC#2", {"-a"},
     255, "", {I("Creating reserved area 4429185024 bytes"),
      E("error writing: No space left on device")}, with(boot, {kReserved}),
     [=](FakeDevice& d) { d.remove(kReserved), space(kCreate)(d); },
     [](FakeDevice& d) { EXPECT_EQ(d.read_file(kReserved).size(), 65536u); }},
    {"an immutable reserved file counts as missing: its creation fails", "", {"-a"}, 255, "",
     {E("failed to open file:" + kReserved + " for writing: Operation not permitted")}, boot,
     shell("chattr +i $R" + kReserved), shell("chattr -i $R" + kReserved)},
    {"no mount table at boot: no block device, result 1", "", {"-a"}, 1, "",
     {E("failed to read default fstab")}, boot, shell("mv $R" + kFstab + " $R" + kFstab + ".away"),
     shell("mv $R" + kFstab + ".away $R" + kFstab)},
    {"misc gone while a disable request is applied at boot", "fopen.misc=ENOENT+3", {"-a"}, 255,
     misc_gone + ", item=2.\n", {E("error writing ramdump disable initial block header to MISC "
     "partition"), E("Failed to disable ramdump")}, {kLba, kRdmp},
     [](FakeDevice& d) { d.write_file(kStatus, "disable"); }},
    {"FIBMAP fails at boot: nothing read out, nothing stored", "fibmap=EINVAL@0", {"-a"}, 255, "",
     {E("Failed to get block 0 for file " + kReserved + "; Invalid argument")}, boot},
    {"misc gone before the header is read at boot", "fopen.misc=ENOENT+4", {"-a"}, 255,
     misc_gone + ", item=2\n", {E("Failed to read initial block header from MISC partition")},
     boot},
    {"misc gone when the header is marked before the read-out: nothing read out",
     "fopen.misc=ENOENT#5", {"-a"}, 255, misc_gone + ", item=2.\n",
     {E("Failed to write new initial block header to MISC partition")}, boot},
    {"misc gone while an enable request is applied at boot", "fopen.misc=ENOENT+3", {"-a"}, 255,
     misc_gone + ", item=3.\n",
     {E("error writing ramdump enable flag to MISC partition"), E("Failed to enable ramdump")},
     {kLba, kRdmp},
     [](FakeDevice& d) { d.write_file(kStatus, "enable"); }},
    {"EIO reading the device at boot: the read-out fails, the chain is re-armed", "read.dev=EIO+1",
     {"-a"}, 255, "",
     {E("error reading: Input/output error"), E("Failed to read out ramdump from reserved blocks")},
     with(boot, {kIbh, kOutput, kMessage}), nullptr,
     [](FakeDevice& d) { EXPECT_EQ(verify_chain(d, reserved, kCrc, true), ""); }, kReserved},
    {"the lock cannot be taken at boot", "flock=EINVAL+1", {"-a"}, 255, "", {lock}, {kKvdump}},
    {"the same for enable full: its status stays 0", "flock=EINVAL+1", {"enable", "full"}, 0, "",
     {lock}, {kKvdump}},
    {"no dump stored: the header is stored armed, its other bits kept", "", {"-a"}, 255, "",
     {E("No ramdump found, exiting")}, with(boot, {kIbh}), state(0x80000004u, 0x80000005u)},
    {"misc gone for the block address, and for the header after the re-arming: the cycle goes on, "
     "the header stays as marked before the read-out", "fopen.misc=ENOENT#2,fopen.misc=ENOENT#6",
     {"-a"}, 0, misc_gone + ", item=1.\n" + misc_gone + ", item=2.\n",
     {E("error writing ramdump disable lba to MISC partition"), found, bad_magic,
      E("Failed to write new initial block header to MISC partition")}, read_out, state(6, 5),
     nullptr, kReserved},
    {"an enable request, exactly 6 GiB free, a looping chain: read out, re-armed", "",
     {"-a", "-i", "1"}, 0, "", {I("Enabling ramdump"), found, bad_magic},
     with(collected, {kFlag, kApq, kOutDir}), [=](FakeDevice& d) {
       set_misc_item(d, 3216, "DiSa"), d.write_file(kStatus, "enabled");
       fs::remove_all(d.host_path(kApq)), relink(d, reserved, 5, reserved[2]), space(kKeep)(d);
     }, [](FakeDevice& d) {
       EXPECT_EQ(d.read_file(kMessage), kMsgText);
       EXPECT_EQ(verify_chain(d, reserved, kCrc, true), "");
       // Made here; apq/00 is made anew by every read-out, where another mode would show.
       EXPECT_EQ(fs::status(d.host_path(kApq)).permissions(), fs::perms::all);
     }, kReserved},
    {"enable full, whatever the request; hostile record names: only the message file written", "",
     {"enable", "full"}, 0, "", {I("Found file 'RAMDUMP_MSG.txt', size 6")},
     with(read_out, {kFlag}), [](FakeDevice& d) {
       d.write_file(kStatus, "disable");
       const std::string stream = dump_record("../../../../etc/pwn", 10, "0123456789") +
           dump_record("RAMDUMP_MSG.txt/../x", 5, "AAAAA") /* 20 bytes, no terminator */ +
           dump_record("/RAMDUMP_MSG.txt", 3, "BBB") + dump_record("..", 2, "CC") +
           dump_record("RAMDUMP_MSG.txt", 6, "hello\n") +
           dump_record("../RAMDUMP_MSG.txt", UINT64_MAX, std::string(5000, 'Z'));
       for (size_t k = 0; k * 4080 < stream.size(); ++k) {
         d.write_raw(reserved[k] * 4096ull + 16, stream.substr(k * 4080, 4080));
       }
     }, [](FakeDevice& d) { EXPECT_EQ(d.read_file(kMessage), "hello\n"); }, kReserved},
  };
  // clang-format on
}

TEST(FaultInjection, EveryCase) {
  std::string why;
  if (!fake_device_supported(&why)) GTEST_SKIP() << why;
  // Under a wrapper (valgrind, an emulator) nothing is preloaded: only the rows without a fault
  // run, but for a failed read-out (it leaves its buffer to the exit), and raw writes are not
  // traced.
  const char* wrapper = getenv("RB_TEST_WRAPPER");
  const bool wrapped = wrapper != nullptr && wrapper[0] != '\0';
  FakeDeviceConfig config;
  config.data_bytes = 16ull << 30;  // the boot entry wants 10 GiB free to create the file
  config.cmdline = "console=ttyS0 androidboot.hardware=rbtest androidboot.android_dt_dir=/dt\n";
  FakeDevice d(config);
  ASSERT_EQ(d.setup_error(), "");
  d.write_file("/system/lib/libfault_inject.so", read_host_file(RB_FAULT_LIBRARY), 0755);
  fs::create_symlink("/usr/bin/env", d.host_path("/system/bin/env"));
  d.write_file("/tmp/RAMDUMP_MSG.txt", kMsgText);
  d.write_file("/tmp/memory0.bin", std::string(9000, '\x22'));
  d.write_file(kArmed, std::string(kArmedCount * 4096, '\x77'));
  armed = arm(d, kArmed, kArmedCount);
  for (const Case& c : cases()) {
    if (wrapped && (!c.fault.empty() || c.args[0] == "-r")) continue;
    SCOPED_TRACE(c.name);
    prepare(
        d, c.args[0] == "-a" || c.args[0] == "enable" || c.program != std::string("reserveblocks"));
    if (c.tamper) c.tamper(d);
    const Snapshot before = snapshot(d);
    d.remove(kTrace);
    // The interposer preloaded (a sanitizer build wants its runtime first; it only forwards).
    std::vector<std::string> args = {"RB_FAULT=" + c.fault, "RB_FAULT_TRACE=" + kTrace,
                                     "LD_PRELOAD=/system/lib/libfault_inject.so",
                                     "ASAN_OPTIONS=detect_leaks=0:verify_asan_link_order=0",
                                     "/system/bin/" + std::string(c.program)};
    args.insert(args.end(), c.args.begin(), c.args.end());
    result = wrapped ? d.run(c.args, c.program) : d.run(args, "env", 60);
    const std::string log = tool_log(d);
    ASSERT_FALSE(result.timed_out);  // no path may loop
    EXPECT_EQ(result.status, c.status) << result.err << log;
    EXPECT_EQ(result.err.find("fault_inject: ") != std::string::npos, !c.fault.empty());
    EXPECT_EQ(result.out, c.out.value_or(result.out));
    EXPECT_TRUE(log_matches(log, c.log)) << log;
    EXPECT_EQ(changed(before, snapshot(d)), c.changed);
    // A block address that changed is the disabled one; a flag or header that changed was
    // disabled ("DiSa", zeros) or enabled and re-armed; the progress property reads "done" after
    // a read-out, which publishes its directory.
    const auto has = [&](const std::string& item) { return c.changed.count(item) != 0; };
    const std::string misc = d.misc_bytes(), flag = misc.substr(3216, 4);
    const bool disabled = flag == "DiSa" && has(kFlag);
    EXPECT_EQ(misc.substr(3136, 4), has(kLba) ? std::string(4, '\xff') : misc.substr(3136, 4));
    EXPECT_EQ(flag, has(kFlag) && !disabled ? "EnAb" : flag);
    EXPECT_EQ(misc.substr(3184, 24), !has(kIbh) ? misc.substr(3184, 24)
                                     : disabled ? std::string(24, '\0')
                                                : ibh);
    EXPECT_EQ(d.read_file(kKvdump), has(kNewDir) ? "done" : has(kKvdump) ? "fail" : "");
    EXPECT_EQ(d.read_file(kNewDir), has(kNewDir) ? kOutDir : "");
    EXPECT_EQ(wrapped ? "" : raw_writes(d, c.written), "");
    if (c.check) c.check(d);
  }
}

}  // namespace
