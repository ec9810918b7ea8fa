// ramdump_inspect verify and misc, and firmware_sim's read-only and placement options, run as
// built on image files: a sparse "device" armed by the tool's own chain writer and a misc image.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <functional>
#include <string>
#include <vector>

#include "misc/misc_store.h"
#include "ramdump/arming.h"
#include "ramdump/chain_format.h"
#include "tests/harness/chain_checks.h"
#include "tests/harness/fake_device.h"

namespace {

constexpr uint32_t kCrc = 0x5eed1234;

struct Outcome {
  int status;
  std::string out;  // standard output and error
  double seconds;
};

Outcome run(const std::string& program, const std::string& args) {
  auto start = std::chrono::steady_clock::now();
  const char* wrapper = getenv("RB_TEST_WRAPPER");  // an emulator, in the aarch64 run
  FILE* p = popen((std::string(wrapper != nullptr ? wrapper : "") + " " + RB_BUILD_DIR + "/" +
                   program + " " + args + " 2>&1")
                      .c_str(),
                  "r");
  Outcome r{-1, "", 0};
  char buf[4096];
  for (size_t n; (n = fread(buf, 1, sizeof(buf), p)) > 0;) r.out.append(buf, n);
  const int status = pclose(p);
  r.status = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  r.seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
  return r;
}

// A chain over blocks (two runs of 1024 and 476, then three short ones) armed into a sparse
// device image, its read-out, and a misc image that names it.
struct Chain {
  static inline int made = 0;
  std::string dir = std::filesystem::temp_directory_path() /
                    ("inspect." + std::to_string(getpid()) + "." + std::to_string(++made));
  std::string dev = dir + "/dev.img", misc = dir + "/misc.img", out = dir + "/out.bin";
  std::vector<int64_t> blocks;
  int fd;

  Chain() {
    std::filesystem::create_directories(dir);
    for (int64_t b = 100; b < 1600; ++b) blocks.push_back(b);
    for (int64_t b : {2500, 1700, 1701, 1702, 3000}) blocks.push_back(b);
    fd = open(dev.c_str(), O_RDWR | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    std::vector<uint8_t> buffer(MAX_RUN_BLOCKS * 4096, 0);
    write_chain(fd, blocks.data(), blocks.size(), buffer.data(), 4096, kCrc, 0);
    set_misc(3184, make_ibh(100, 4096, blocks.size(), kCrc, STATE_ARMED));
  }
  ~Chain() {
    close(fd);
    std::filesystem::remove_all(dir);
  }

  void set_misc(size_t offset, const std::string& bytes) {
    std::string image = read_host_file(misc);
    image.resize(std::max<size_t>(image.size(), 4096), '\0');
    write_host_file(misc, image.replace(offset, bytes.size(), bytes));
  }
  // Changes the header of chain block index; with fix_crc, its CRC follows the change.
  void patch(size_t index, const std::function<void(chain_block_header&)>& change,
             bool fix_crc = false) {
    uint8_t raw[16];
    ASSERT_EQ(pread(fd, raw, 16, blocks[index] * 4096), 16);
    chain_block_header h = decode_chain_block_header(raw);
    change(h);
    uint32_t crc = kCrc;
    for (size_t i = 0; fix_crc && i <= index; ++i) {
      crc = chain_crc(crc, blocks[i], i < index ? blocks[i + 1] : h.next_block);
    }
    if (fix_crc) h.crc = crc;
    encode_chain_block_header(h, raw);
    ASSERT_EQ(pwrite(fd, raw, 16, blocks[index] * 4096), 16);
  }
  // The read-out: the chain's blocks in chain order.
  void read_out() {
    std::string output(blocks.size() * 4096, '\0');
    for (size_t i = 0; i < blocks.size(); ++i) {
      ASSERT_EQ(pread(fd, &output[i * 4096], 4096, blocks[i] * 4096), 4096);
    }
    write_host_file(out, output);
  }
  std::string fill(const std::string& args) const {
    std::string s = args;
    for (auto [key, value] :
         {std::pair<std::string, std::string>{"MISC", misc}, {"DEV", dev}, {"OUT", out}}) {
      for (size_t at; (at = s.find(key)) != std::string::npos;) s.replace(at, key.size(), value);
    }
    return s;
  }
};

TEST(InspectVerify, Chains) {
  using Damage = std::function<void(Chain&)>;
  auto header = [](size_t index, std::function<void(chain_block_header&)> change,
                   bool fix = false) { return [=](Chain& c) { c.patch(index, change, fix); }; };
  auto stored = [](uint32_t count, uint32_t crc) {
    return [=](Chain& c) { c.set_misc(3184, make_ibh(100, 4096, count, crc, 1)); };
  };
  auto crc = [](auto& h) { h.crc ^= 1; };
  const std::string dev = "--device DEV --misc MISC";
  struct {
    const char* name;
    Damage damage;
    std::string args;
    int status;
    std::vector<std::string> expected;
  } rows[] = {
      // clang-format off
      {"good, block 0 unchecked", nullptr, "OUT", 0, {"blocks: 1505\n", "runs: 5, longest 1024\n",
       "run lengths: 1: 2, 2-3: 1, 256-511: 1, 1024: 1\n", "chain block 0: CRC not checked", "result: good\n"}},
      {"good, from misc", nullptr, "--misc MISC OUT", 0, {"blocks: 1505\n", "result: good\n"}},
      {"block 0 from its number and initial CRC", nullptr, "--first-block 100 --initial-crc 5eed1234 OUT", 0,
       {"result: good\n"}},
      {"block 0 with another number", nullptr, "--first-block 0x65 --initial-crc 5eed1234 OUT", 1,
       {"first bad block: chain block 0 (block 101): bad CRC"}},
      {"block 0 through misc", stored(1505, 7), "--misc MISC OUT", 1, {"chain block 0 (block 100): bad CRC"}},
      {"CRC inside a run", header(500, crc), "OUT", 1, {"first bad block: chain block 500 (block 600): bad CRC"}},
      {"bad magic", header(1502, [](auto& h) { h.magic = 0; }), "OUT", 1,
       {"chain block 1502 (block 1701): bad magic 00000000"}},
      {"run_remaining off by one", header(700, [](auto& h) { ++h.run_remaining; }), "OUT", 1,
       {"chain block 700 (block 800): run_remaining 325 inside a run, expected 324"}},
      {"a run that claims a jump", header(1500, [](auto& h) { h.run_remaining = 2; }), "OUT", 1,
       {"chain block 1500 (block 2500): run_remaining 2, but next_block 1700 is not block 2500 + 1"}},
      {"chain does not end", header(1504, [](auto& h) { h.next_block = 77; }, true), "OUT", 1,
       {"chain block 1504 (block 3000): the chain does not end: next_block 77"}},
      {"chain ends early", header(1023, [](auto& h) { h.next_block = 0; }, true), "OUT", 1,
       {"chain block 1023 (block 1123): next_block 0 ends the chain, but more"}},
      {"stored count one too many", stored(1506, kCrc), "--misc MISC OUT", 1,
       {"1505 blocks, but the stored header counts 1506"}},
      {"device: good", nullptr, dev, 0, {"device: ", "blocks: 1505\n", "result: good\n"}},
      {"device: CRC", header(1200, crc), dev, 1, {"blocks: 1200\n", "chain block 1200 (block 1300): bad CRC"}},
      {"device: loop", header(1504, [](auto& h) { h.next_block = 1700; }, true), dev, 1,
       {"chain goes on past its 1505 blocks (to block 1700)"}},
      {"device: stored count one too many", stored(1506, kCrc), dev, 1, {"chain ends after 1505 of 1506 blocks"}},
      {"device: disabled header", [](Chain& c) { c.set_misc(3184, std::string(24, '\0')); }, dev, 1,
       {"24 zero bytes: the disabled form, it names no chain"}},
      // clang-format on
  };
  for (const auto& row : rows) {
    Chain c;
    if (row.damage) row.damage(c);
    c.read_out();
    struct stat before, after;
    ASSERT_EQ(stat(c.dev.c_str(), &before), 0);
    const std::string image = read_host_file(c.dev);
    Outcome r = run("ramdump_inspect", "verify " + c.fill(row.args));
    EXPECT_EQ(r.status, row.status) << row.name << "\n" << r.out;
    for (const auto& text : row.expected)
      EXPECT_TRUE(contains(r.out, text)) << row.name << "\n" << r.out;
    EXPECT_LT(r.seconds, 20.0) << row.name;  // a looping chain is cut short, not walked for ever
    // Read only: not a byte or a time stamp of the device changes.
    ASSERT_EQ(stat(c.dev.c_str(), &after), 0);
    EXPECT_TRUE(before.st_mtim.tv_sec == after.st_mtim.tv_sec &&
                before.st_mtim.tv_nsec == after.st_mtim.tv_nsec && read_host_file(c.dev) == image)
        << row.name;
  }
}

TEST(InspectMisc, Items) {
  struct {
    std::string flag, ibh, lba;
    std::vector<std::string> expected;
  } rows[] = {
      // clang-format off
      {"DiSa", std::string(24, '\0'), "\xff\xff\xff\xff", {"\"DiSa\": disabled\n",
       "24 zero bytes: the disabled form, it names no chain", "block address (offset 3136): ffffffff: the disable value"}},
      {std::string(4, '\0'), make_ibh(0x1234, 4096, 99, 0xabc, 0x13), "\x10\0\0\0", {": enabled\n", "first block  4660\n",
       "initial CRC  00000abc\n", "state        00000013: armed, dump present, other bits 00000010\n",
       "00000010: a block address, not the disable value"}},
      {"disa", "BHdx" + make_ibh(1, 2, 3, 4, 0).substr(4), "", {": enabled\n", "names no chain"}},
      // clang-format on
  };
  for (const auto& row : rows) {
    Chain c;
    c.set_misc(3216, row.flag);
    c.set_misc(3184, row.ibh);
    c.set_misc(3136, row.lba);
    Outcome r = run("ramdump_inspect", "misc " + c.misc);
    EXPECT_EQ(r.status, 0) << r.out;
    for (const auto& text : row.expected) EXPECT_TRUE(contains(r.out, text)) << r.out;
  }
  Chain c;
  write_host_file(c.misc, read_host_file(c.misc).substr(0, 3219));
  Outcome r = run("ramdump_inspect", "misc " + c.misc);
  EXPECT_EQ(r.status, 1);
  EXPECT_TRUE(contains(r.out, "too short")) << r.out;
}

TEST(FirmwareSim, VerifyOnlyAndFirstRecordAt) {
  Chain c;
  const std::string misc = read_host_file(c.misc), image = read_host_file(c.dev);
  Outcome r = run("firmware_sim", "--verify-only " + c.fill("MISC DEV"));
  EXPECT_EQ(r.status, 0) << r.out;
  EXPECT_EQ(r.out, "chain: 1505 blocks from block 100 verified (initial CRC 5eed1234)\n");
  EXPECT_TRUE(read_host_file(c.misc) == misc && read_host_file(c.dev) == image);
  EXPECT_EQ(run("firmware_sim", "--first-record-at 39 " + c.fill("MISC DEV")).status, 2);

  // Each offset splits the file's record header another way across the first two payloads.
  for (uint64_t at : {4079u, 4060u, 40u}) {  // 1, 20 and 4040 bytes before the end
    Chain c;
    const std::string content(5000, 'm'), file = c.dir + "/memory0.bin";
    write_host_file(file, content);
    r = run("firmware_sim",
            "--first-record-at " + std::to_string(at) + c.fill(" MISC DEV ") + file);
    ASSERT_EQ(r.status, 0) << r.out;
    std::string stream, device = read_host_file(c.dev);
    for (size_t k = 0; k < 4; ++k) stream += device.substr(c.blocks[k] * 4096 + 16, 4080);
    // Record headers without their reserved field, which readers ignore.
    EXPECT_EQ(stream.substr(0, 32), dump_record("filler.bin", at - 40, "").substr(0, 32)) << at;
    EXPECT_EQ(stream.substr(40, at - 40), std::string(at - 40, '\0')) << at;
    EXPECT_EQ(stream.substr(at, 32), dump_record("memory0.bin", 5000, "").substr(0, 32)) << at;
    EXPECT_EQ(stream.substr(at + 40, 5000), content) << at;
    EXPECT_EQ(le32_at(read_host_file(c.misc), 3184 + 20), STATE_ARMED | STATE_DUMP_PRESENT);
  }
}

}  // namespace
