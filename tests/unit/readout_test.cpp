// Read-outs and the images around them as their readers take them: the tool's own message
// extraction, and the host tools as built (ramdump_inspect, firmware_sim's options).
#include <android/log.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "ramdump/arming.h"
#include "ramdump/chain_format.h"
#include "ramdump/dump_extract.h"
#include "tests/harness/chain_checks.h"

namespace {

namespace fs = std::filesystem;
using Files = std::map<std::string, std::string>;
constexpr size_t P = 4080;  // payload bytes of a unit
constexpr uint32_t kCrc = 0x5eed1234;
constexpr char kMsg[] = "RAMDUMP_MSG.txt";

std::string pattern(size_t n, unsigned seed) {
  std::string s(n, '\0');
  for (size_t i = 0; i < n; ++i) s[i] = static_cast<char>((i * 13 + seed) % 251);
  return s;
}

struct Rec {
  std::string name, content;
  std::optional<uint64_t> size = std::nullopt;  // the content's size when not given
};

std::string stream_of(const std::vector<Rec>& recs) {
  std::string s;
  for (const Rec& r : recs) s += dump_record(r.name, r.size.value_or(r.content.size()), r.content);
  return s;
}

// The records part of list --json: offsets from the layout, a record incomplete when its
// content falls short of its size, a name noted when it repeats.
std::string records_json(const std::vector<Rec>& recs) {
  std::string out, names = "/";
  uint64_t offset = 0;
  for (const Rec& r : recs) {
    const uint64_t size = r.size.value_or(r.content.size()), got = r.content.size();
    const bool repeated = contains(names, "/" + r.name + "/");
    names += r.name + "/";
    out += std::string(out.empty() ? "" : ",") + "\n  {\"name\": \"" + r.name +
           "\", \"size\": " + std::to_string(size) + ", \"offset\": " + std::to_string(offset) +
           ", \"complete\": " +
           (size == got ? "true, \"notes\": ["
                        : "false, \"notes\": [\"incomplete: " + std::to_string(got) + " bytes\"") +
           (repeated ? (size == got ? "\"repeated name\"]}" : ", \"repeated name\"]}") : "]}");
    offset += 40 + got;
  }
  return "{\"records\": [" + out + (out.empty() ? "" : "\n") + "], \"end\": ";
}

// Writes bytes into a file at offset.
void write_at(const std::string& path, size_t offset, const std::string& bytes) {
  std::fstream(path, std::ios::in | std::ios::out | std::ios::binary).seekp(offset) << bytes;
}

// Whether the file holds exactly bytes, read piece by piece (a copy of the image is slow here).
bool holds(const std::string& path, const std::string& bytes) {
  std::ifstream in(path, std::ios::binary);
  char piece[1 << 16];
  size_t at = 0;
  while (in.read(piece, sizeof(piece)).gcount() > 0 &&
         bytes.compare(at, in.gcount(), piece, in.gcount()) == 0)
    at += in.gcount();
  return at == bytes.size() && in.gcount() == 0;
}

class Readout : public testing::Test {
 protected:
  void TearDown() override { fs::remove_all(dir_); }

  // A program of the build with its arguments, under RB_TEST_WRAPPER (an emulator) when set.
  RunResult run(const std::string& command) {
    const char* wrapper = getenv("RB_TEST_WRAPPER");
    const std::string line = std::string(wrapper ? wrapper : "") + " " RB_BUILD_DIR "/" + command;
    const int w = system((line + " >" + dir_ + "/out 2>" + dir_ + "/err").c_str());
    return {read_host_file(dir_ + "/out"), read_host_file(dir_ + "/err"),
            WIFEXITED(w) ? WEXITSTATUS(w) : -1};
  }

  // Every file below dir, by its path relative to it, with its content.
  Files files(const std::string& dir) {
    Files out;
    for (const auto& e : fs::recursive_directory_iterator(dir))
      out[e.path().lexically_relative(dir)] = read_host_file(e.path());
    return out;
  }

  // Blocks in two runs of 1024 and 476, then three short ones, armed into a sparse device image
  // (kept in image_) with a misc image that names them, and the read-out.
  void arm() {
    for (int64_t b = 100; b < 1600; ++b) blocks_.push_back(b);
    blocks_.insert(blocks_.end(), {2500, 1700, 1701, 1702, 3000});
    const int fd = open(dev_.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
    std::vector<uint8_t> buffer(MAX_RUN_BLOCKS * 4096, 0);
    write_chain(fd, blocks_.data(), blocks_.size(), buffer.data(), 4096, kCrc, 0);
    image_.assign(lseek(fd, 0, SEEK_END), '\0');
    EXPECT_EQ(pread(fd, image_.data(), image_.size(), 0), static_cast<ssize_t>(image_.size()));
    close(fd);
    write_host_file(misc_, std::string(4096, '\0'));
    write_at(misc_, 3184, make_ibh(100, 4096, blocks_.size(), kCrc, STATE_ARMED));
    write_host_file(readout_, raw_blocks(dev_, blocks_));
  }
  // Changes the header of chain block i in image_, on the device and in the read-out, and notes
  // the former one in undo_; with fix, its CRC follows the change.
  void patch(size_t i, const std::function<void(chain_block_header&)>& change, bool fix = false) {
    auto at = [&](size_t k) { return reinterpret_cast<uint8_t*>(&image_[blocks_[k] * 4096]); };
    undo_.emplace_back(i, decode_chain_block_header(at(i)));
    chain_block_header h = undo_.back().second;
    change(h);
    if (fix) h.crc = chain_crc(decode_chain_block_header(at(i - 1)).crc, blocks_[i], h.next_block);
    put(i, h);
  }
  void put(size_t i, const chain_block_header& h) {
    encode_chain_block_header(h, reinterpret_cast<uint8_t*>(&image_[blocks_[i] * 4096]));
    const std::string raw = image_.substr(blocks_[i] * 4096, CHAIN_BLOCK_HEADER_SIZE);
    write_at(dev_, blocks_[i] * 4096, raw), write_at(readout_, i * 4096, raw);
  }

  std::string dir_ = testing::TempDir() + "readout_XXXXXX";
  const std::string readout_ = (mkdtemp(dir_.data()), dir_ + "/RAMDUMP_OUTPUT"), x_ = dir_ + "/x",
                    dev_ = dir_ + "/dev.img", misc_ = dir_ + "/misc.img";
  std::vector<int64_t> blocks_;
  std::string image_;                                        // the device image as written here
  std::vector<std::pair<size_t, chain_block_header>> undo_;  // chain blocks and former headers
};

// Records across unit boundaries and read-outs that end badly: what list says (whether the tool
// extracts the message whole, too; readout_stream_fuzz holds its model to the real extraction)
// and exits with, and what extract writes.
TEST_F(Readout, StreamsAndEndings) {
  umask(022);
  // clang-format off
  // readout: "" for the records' own; err: in list's error or detail; message: the tool writes RAMDUMP_MSG.txt whole.
  struct Row { std::vector<Rec> recs; std::string readout, err; uint64_t end; const char* reason; int status; bool message; };
  const std::string msg = pattern(2 * P + 9, 9), k = "k" + std::string(P - 81, '\0');
  std::vector<Row> rows;
  // The message header d bytes before a unit's end: each edge of the classes 0-16, 17-39 (which
  // the tool reassembles wrongly) and 40+, and a cut magic.
  for (size_t d : {0, 2, 16, 17, 39, 40, 45})
    rows.push_back({{{"memory0.bin", pattern(P - d - 40, 1)}, {"RAMDUMP_MSG.txt", msg}}, "", "",
                    P - d + 40 + msg.size(), "bad_magic", 0, d < 17 || d > 39});
  std::string bad_chain = readout_units(stream_of({{"memory0.bin", pattern(P - 40, 7), 6000}}) + pattern(1960, 7));
  bad_chain[4096] = 'X';  // chain block magic of unit 1
  const std::string head =
      stream_of({{"memory0.bin", pattern(P - 60, 8)}}) + dump_record("kernel_log.bin", 9, "").substr(0, 20);
  rows.insert(rows.end(), {
      // 20 bytes before a unit's end, "F1Le" in a name where the tool takes the magic from.
      {{{"memory0.bin", pattern(P - 60, 1)}, {"kernel_log01F1Le", "k"}, {"RAMDUMP_MSG.txt", msg}}, "", "",
       P + 61 + msg.size(), "bad_magic", 0, true},
      // The tool fails after an empty message, and so keeps it.
      {{{"RAMDUMP_MSG.txt", ""}, {"RAMDUMP_MSG.txt", k, 9000}}, "", "inside a record at stream offset 4080", P,
       "cut_record", 1, true},
      {rows[0].recs, readout_units(stream_of(rows[0].recs)) + "xyz", "partial unit of 3 bytes at offset 16384",
       rows[0].end, "bad_magic", 1, true},
      {{{"memory0.bin", pattern(5000, 4)}, {"trace.bin", pattern(2 * P - 5080, 5), 9000}}, "",
       "inside a record at stream offset 8160", 8160, "cut_record", 1, false},
      {{{"memory0.bin", pattern(P - 40, 6), ~0ull}}, "", "inside a record at stream offset 4080", 4080,
       "cut_record", 1, false},
      {{{"memory0.bin", pattern(P - 40, 7), 6000}}, bad_chain,
       "unit 1 at offset 4096 has chain block magic 6f684358, not 6f684342 (\\\"BCho\\\") (the data ends inside a record)",
       4080, "bad_chain_magic", 1, false},
      {{{"memory0.bin", pattern(P - 60, 8)}}, readout_units(head), "inside a record header at stream offset 4060",
       4060, "cut_header", 1, false}});
  // firmware_sim's filler record puts the next record's header 1 byte before a unit's end.
  const std::string m(5000, 'm');
  write_host_file(dir_ + "/memory0.bin", m);
  arm();
  ASSERT_EQ(run("firmware_sim --first-record-at 4079 " + misc_ + " " + dev_ + " " + dir_ + "/memory0.bin").status, 0);
  rows.push_back({{{"filler.bin", std::string(4039, '\0')}, {"memory0.bin", m}}, raw_blocks(dev_, blocks_), "", 4079 + 5040,
                  "bad_magic", 0, false});
  EXPECT_EQ(le32_at(read_host_file(misc_), 3184 + 20), STATE_ARMED | STATE_DUMP_PRESENT);
  // clang-format on
  for (const Row& row : rows) {
    SCOPED_TRACE(row.err + " " + std::to_string(row.end));
    write_host_file(readout_,
                    row.readout.empty() ? readout_units(stream_of(row.recs)) : row.readout);
    RunResult list = run("ramdump_inspect list --json " + readout_);
    EXPECT_EQ(list.status, row.status);
    EXPECT_EQ(list.out.substr(0, list.out.find("\"detail\"")),
              records_json(row.recs) + "{\"offset\": " + std::to_string(row.end) +
                  ", \"reason\": \"" + row.reason + "\", ");
    EXPECT_TRUE(contains(list.out, row.message ? "message\": true}" : "message\": false}"));
    EXPECT_TRUE(contains(list.err + list.out, row.err)) << list.err;

    fs::remove_all(x_);
    EXPECT_EQ(run("ramdump_inspect extract " + readout_ + " " + x_).status, row.status);
    EXPECT_EQ(fs::status(x_).permissions(), fs::perms(0755));  // made under the umask 022
    Files want;
    for (const Rec& r : row.recs) want[want.count(r.name) ? r.name + ".1" : r.name] = r.content;
    EXPECT_EQ(files(x_), want);
  }
}

// Usage errors, inputs and outputs that are refused, names that are not safe file names or
// repeat, and what extract does with what is already in DIR (x) and with NAME arguments.
TEST_F(Readout, CommandsNamesAndTargets) {
  // clang-format off
  const std::string readout = readout_units(stream_of({{"memory0.bin", "new"}, {"RAMDUMP_OUTPUT", "log"}}));
  write_host_file(readout_, readout);
  const std::string &r = readout_, &d = dir_, names = d + "/names", split = d + "/split", real = d + "/real",
                    outside = d + "/outside";
  const std::pair<std::string, std::string> unsafe[] = {  // record name, file name
      {"kernel_log.bin", "kernel_log.bin"}, {"kernel_log.bin", "kernel_log.bin.1"}, {"../../escape", ".._.._escape"},
      {"..", "record_123"}, {"", "record_164"}, {"ttyS0\x1flog", "ttyS0_log"},
      {"abcdefghijklmnopqrstuvw", "abcdefghijklmnopqrst_"}, {"kernel_log.bin.1", "kernel_log.bin.1.1"}, {"/", "_"}};
  std::vector<Rec> recs;
  Files safe;
  for (const auto& [name, file] : unsafe)
    recs.push_back({name, std::string(1, 'a' + recs.size())}), safe[file] = recs.back().content;
  write_host_file(names, readout_units(stream_of(recs)));
  write_host_file(split, readout_units(stream_of({{"memory0.bin", pattern(P - 57, 1)}, {"RAMDUMP_MSG.txt", "m"}})));
  ASSERT_EQ(mkfifo((d + "/fifo").c_str(), 0600), 0);
  write_host_file(outside, "keep");
  const Files log = {{"RAMDUMP_OUTPUT", "log"}}, old = {{"memory0.bin", "old"}, *log.begin()},
              both = {{"memory0.bin", "new"}, *log.begin()}, link = {{"memory0.bin", "keep"}, *log.begin()};
  // before: in x/memory0.bin f a file, l a link to outside; d: x is a link to real. x: what x holds after.
  struct { char before; std::string args, err; int status; std::vector<std::string> out = {}; Files x = {}; } rows[] = {
      {' ', "", "no command given\nusage: ramdump_inspect COMMAND", 2},
      {' ', "list --help", "", 0, {"usage: ramdump_inspect list [--json] OUTPUT\n"}},
      {' ', "list --bogus " + r, "unknown option '--bogus'\nusage: ramdump_inspect list", 2},
      {' ', "extract " + r, "usage: ramdump_inspect extract", 2},
      {' ', "list " + d + "/missing", ": " + d + "/missing: No such file or directory\n", 1},
      {' ', "extract " + r + " " + d + "/no/x", "/no/x: cannot be created", 1},
      {' ', "strip " + r + " " + r, "is the read-out itself\n", 1},
      {' ', "strip " + r + " " + d + "/fifo", "a FIFO without a reader\n", 1},
      {' ', "strip " + r + " /dev/full", "/dev/full: write failed: No space left on device\n", 1},
      {' ', "strip " + r + " " + x_ + "/stream", "", 0, {"x/stream: 4080 bytes of dump stream from 1 units\n"},
       {{"stream", readout.substr(16)}}},
      {' ', "list " + d + "/fifo", "", 0, {"no records"}},
      {' ', "extract --force " + r + " " + d, "RAMDUMP_OUTPUT: is the read-out being read", 1, {"memory0.bin: 3 bytes"}},
      {'f', "extract " + r + " " + x_, "x/memory0.bin: exists; --force replaces it", 1, {}, old},
      {'f', "extract --force " + r + " " + x_, "", 0, {}, both},
      {'l', "extract --force " + r + " " + x_, "exists and is not a regular file", 1, {}, link},
      {'d', "extract " + r + " " + x_ + "/", "x: is a symbolic link, which is not followed", 1},
      {' ', "extract " + r + " " + x_ + " RAMDUMP_OUTPUT", "", 0, {}, log},
      {' ', "extract " + r + " " + x_ + " trace.bin", "no record named \"trace.bin\"", 1},
      {' ', "extract " + names + " " + x_, "", 0, {"record_123: 1 bytes (the name \"..\" is not a safe file name)\n",
       "kernel_log.bin.1.1: 1 bytes (\"kernel_log.bin.1\" is taken)\n",
       "ttyS0_log: 1 bytes (the name \"ttyS0\\x1flog\" is not a safe file name)\n"}, safe},
      {' ', "list --json " + names, "", 0, {
       "\"ttyS0\\u001flog\", \"size\": 1, \"offset\": 205, \"complete\": true, \"notes\": [\"unsafe file name\"]}",
       "\"abcdefghijklmnopqrst\", \"size\": 1, \"offset\": 246, \"complete\": true, \"notes\": [\"no terminator\"]}"}},
      {' ', "list " + split, "", 0, {"the tool's extraction stops at stream offset 4063, without RAMDUMP_MSG.txt\n"}},
      {' ', "list " + names, "", 0, {"NAME\n           0 ", "         164                    1    [unsafe file name]\n",
       "end of the stream at offset 369: record magic"}},
  };
  // clang-format on
  for (const auto& row : rows) {
    SCOPED_TRACE(row.args + " " + row.before);
    fs::remove_all(x_), fs::remove_all(real), fs::create_directories(real);
    row.before == 'd' ? fs::create_symlink(real, x_) : void(fs::create_directories(x_));
    if (row.before == 'f') write_host_file(x_ + "/memory0.bin", "old");
    if (row.before == 'l') fs::create_symlink(outside, x_ + "/memory0.bin");
    RunResult result = run("ramdump_inspect " + row.args);
    EXPECT_EQ(result.status, row.status);
    for (const auto& text : row.out) EXPECT_TRUE(contains(result.out, text)) << result.out;
    EXPECT_TRUE(row.err.empty() ? result.err.empty() : contains(result.err, row.err)) << result.err;
    EXPECT_TRUE(row.status != 1 || std::count(result.err.begin(), result.err.end(), '\n') == 1);
    EXPECT_EQ(files(x_), row.x);
  }
  EXPECT_TRUE(files(real).empty() && read_host_file(outside) == "keep" &&
              read_host_file(readout_) == readout);
}

// ramdump_inspect verify and misc, and firmware_sim --verify-only, on a chain and misc image
// damaged in one place each; none of them changes either image.
TEST_F(Readout, VerifyMiscAndFirmwareSim) {
  arm();
  const std::string misc_image = read_host_file(misc_);
  // clang-format off
  auto items = [&](std::string flag, std::string ibh, std::string lba) {
    return [=] { write_at(misc_, 3216, flag), write_at(misc_, 3184, ibh), write_at(misc_, 3136, lba); };
  };
  auto ibh = [&](uint32_t count, uint32_t crc) { return items("", make_ibh(100, 4096, count, crc, 1), ""); };
  auto crc = [](chain_block_header& h) { h.crc ^= 1; };
  const std::string verify = "ramdump_inspect verify ", out = " " + readout_, misc_text = "ramdump_inspect misc " + misc_,
                    on_device = verify + "--device " + dev_ + " --misc " + misc_, stores = verify + "--misc " + misc_ + out;
  const auto state = items("disa", make_ibh(0x1234, 4096, 99, 0xabc, 0x13), "\x10\0\0\0");
  struct { std::function<void()> damage; std::string command; int status; std::vector<std::string> expected; } rows[] = {
      {nullptr, verify + out, 0, {"blocks: 1505\nruns: 5, longest 1024\n"
       "run lengths: 1: 2, 2-3: 1, 256-511: 1, 1024: 1\nchain block 0: CRC not checked", "result: good\n"}},
      {nullptr, verify + "--first-block 0100 --initial-crc 5eed1234" + out, 0, {"result: good\n"}},
      {nullptr, verify + "--first-block 0x65 --initial-crc 5eed1234" + out, 1,
       {"first bad block: chain block 0 (block 101): bad CRC"}},
      {ibh(1505, 7), stores, 1, {"chain block 0 (block 100): bad CRC"}},
      {[&] { patch(500, crc); }, verify + "--json" + out, 1, {"\"blocks\": 1505, \"runs\": 5, \"longest_run\": 1024, "
       "\"run_lengths\": {\"1\": 2, \"2-3\": 1, \"256-511\": 1, \"1024\": 1}, \"block0_checked\": false, \"ok\": false, "
       "\"first_bad\": {\"chain_block\": 500, \"block\": 600, \"reason\": \"bad CRC"}},
      {[&] { patch(1502, [](auto& h) { h.magic = 0; }); }, verify + out, 1,
       {"chain block 1502 (block 1701): bad magic 00000000"}},
      {[&] { patch(700, [](auto& h) { ++h.run_remaining; }); }, verify + out, 1,
       {"chain block 700 (block 800): run_remaining 325 inside a run, expected 324"}},
      {[&] { patch(1500, [](auto& h) { h.run_remaining = 2; }); }, verify + out, 1,
       {"chain block 1500 (block 2500): run_remaining 2, but next_block 1700 is not block 2500 + 1"}},
      {[&] { patch(1504, [](auto& h) { h.next_block = 77; }, true); }, verify + out, 1,
       {"chain block 1504 (block 3000): the chain does not end: next_block 77"}},
      {[&] { patch(1023, [](auto& h) { h.next_block = 0; }, true); }, verify + out, 1,
       {"chain block 1023 (block 1123): next_block 0 ends the chain, but more"}},
      {ibh(1506, kCrc), stores, 1, {"1505 blocks, but the stored header counts 1506"}},
      {nullptr, on_device, 0, {"device: ", "blocks: 1505\n", "result: good\n"}},
      {[&] { patch(1200, crc); }, on_device, 1, {"blocks: 1200\n", "chain block 1200 (block 1300): bad CRC"}},
      {[&] { patch(1504, [](auto& h) { h.next_block = 1700; }, true); }, on_device, 1,
       {"chain goes on past its 1505 blocks (to block 1700)"}},
      {ibh(1506, kCrc), on_device, 1, {"chain ends after 1505 of 1506 blocks"}},
      {items("", "BHdx" + make_ibh(1, 2, 3, 4, 0).substr(4), ""), on_device, 1,
       {"its magic is not \"BHdr\": it names no chain"}},
      {items("DiSa", std::string(24, '\0'), "\xff\xff\xff\xff"), misc_text, 0, {"\"DiSa\": disabled\n",
       "24 zero bytes: the disabled form, it names no chain", "block address (offset 3136): ffffffff: the disable",
       "unused item (offset 3160, left alone by the tool): 00 00 00 00\n"}},
      {state, misc_text, 0, {": enabled\n", "first block  4660\n", "initial CRC  00000abc\n",
       "state        00000013: armed, dump present, other bits 00000010\n", "00000010: a block address, not"}},
      {state, "ramdump_inspect misc --json " + misc_, 0, {"\"names_chain\": true, \"no_chain_reason\": null,",
       "\"state\": 19, \"state_bits\": [\"armed\",\"dump present\",\"other bits 00000010\"]},\n"}},
      {[&] { ASSERT_EQ(truncate(misc_.c_str(), 3219), 0); }, misc_text, 1, {"too short: the misc items end at byte 3220\n"}},
      {nullptr, "firmware_sim --verify-only " + misc_ + " " + dev_, 0,
       {"chain: 1505 blocks from block 100 verified (initial CRC 5eed1234)\n"}},
      {nullptr, "firmware_sim --first-record-at 39 " + misc_ + " " + dev_, 2, {"takes 0 or a number of at least 40\n"}},
  };
  // clang-format on
  for (const auto& row : rows) {
    if (row.damage) row.damage();
    const std::string misc = read_host_file(misc_);
    RunResult r = run(row.command);
    EXPECT_EQ(r.status, row.status) << row.command << "\n" << r.out << r.err;
    for (const auto& text : row.expected)
      EXPECT_TRUE(contains(r.out + r.err, text)) << row.command << r.out << r.err;
    EXPECT_TRUE(holds(dev_, image_) && holds(misc_, misc)) << row.command;
    for (const auto& [i, h] : undo_) put(i, h);
    undo_.clear(), write_host_file(misc_, misc_image);
  }
}

// The tool's extraction of read-outs that end badly: standard error, the message file ("(none)"
// when there is none) and the log.
TEST_F(Readout, ToolExtraction) {
  static std::string logged;  // "<I|E> <message>" per record
  __android_log_set_logger([](const __android_logger_data* data, const char* message) {
    logged += std::string(data->priority == ANDROID_LOG_ERROR ? "E " : "I ") + message;
  });
  const std::string msg = pattern(6000, 7), two_units = readout_units(stream_of({{kMsg, msg}}));
  const std::string damaged = two_units.substr(0, 4096) + "xV4\x12" + two_units.substr(4100);
  const std::string filler = stream_of({{"KLOG", pattern(P - 80, 5)}});  // ends a payload
  const std::string tail = stream_of({{kMsg, "msg"}, {"FW", pattern(P, 9)}});
  const std::string huger = dump_record(kMsg, ~0ull, "k") + tail;
  std::string swallowed = huger.substr(40);  // to the end of the last unit
  swallowed.resize((huger.size() + P - 1) / P * P - 40);
  const std::string found = "I Found file 'RAMDUMP_MSG.txt', size ";
  // Two record headers split at the ends of two payloads in a row, f and s bytes before them.
  const auto splits = [&](size_t f, size_t s) {
    return readout_units(stream_of({{"PMIC", pattern(2 * P - f - 40, 1)},
                                    {"KLOG", pattern(P + f - s - 40, 2)},
                                    {kMsg, msg},
                                    {"FW", ""}}));
  };
  const std::string zeros = "E * bad magic, got 00000000, expecting 654c3146\n";
  struct {
    std::string readout, err, message, log;
  } rows[] = {
      // A zero-length write never reports success: an empty wanted record fails once data follows.
      {readout_units(filler + dump_record(kMsg, 0, "") + tail), "Could not write 0 bytes", "",
       found + "0\n"},
      {readout_units(filler + dump_record(kMsg, 0, "")), "", "", found + "0\n"},
      {damaged, "* bad block header magic, got 12345678, expecting 6f684342\n",
       msg.substr(0, P - 40), found + "6000\n"},
      {two_units.substr(0, 4096 + 1000), "", msg.substr(0, P - 40),  // partial unit unread
       found + "6000\n"},
      // Sizes beyond the data swallow the rest, even past the signed range.
      {readout_units(dump_record("KLOG", 1ull << 40, "k") + tail), "", "(none)", ""},
      {readout_units(huger), "", swallowed, found + "18446744073709551615\n"},
      {"", "Unable to open " + readout_ + " for reading\n", "(none)", ""},
      // A carry of up to 16 bytes comes whole, also where the unit it starts ends in another.
      {splits(1, 16), "", msg, found + "6000\n" + zeros},
      {splits(16, 1), "", msg, found + "6000\n" + zeros},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(&row - rows);
    reset_dump_filter_state_for_test();
    logged.clear();
    fs::remove(readout_), fs::remove(x_ + "/" + kMsg), fs::create_directories(x_);
    if (!row.readout.empty()) write_host_file(readout_, row.readout);
    testing::internal::CaptureStderr();
    EXPECT_EQ(extract_ramdump_msg(readout_.c_str(), x_.c_str()), 0);
    EXPECT_EQ(testing::internal::GetCapturedStderr(), row.err);
    EXPECT_EQ(fs::exists(x_ + "/" + kMsg) ? read_host_file(x_ + "/" + kMsg) : "(none)",
              row.message);
    EXPECT_EQ(logged, row.log);
  }
  __android_log_set_logger(__android_log_stderr_logger);
}

// The path is built for every record; one over 4096 characters ends the process, never cut short.
TEST(ExtractionDeathTest, OutputPathLimit) {
  const std::string stream = dump_record("FW_DIAG", 0, ""), fits(4096 - strlen("/FW_DIAG"), 'd');
  FILE* out = nullptr;
  auto filter = [&](const std::string& out_dir) {
    reset_dump_filter_state_for_test();
    return process_data_filtered(reinterpret_cast<const uint8_t*>(stream.data()),
                                 DUMP_FILE_RECORD_SIZE, &out, kMsg, out_dir.c_str());
  };
  EXPECT_EQ(filter(fits), 0);
  EXPECT_DEATH(filter(fits + "d"), "longer than 4096 characters");
}

}  // namespace
