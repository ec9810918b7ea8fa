// ramdump_inspect list, extract and strip, run as built on read-outs made here, and its model
// of the tool's message extraction against the real one.
#include <android/log.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <sys/wait.h>

#include <algorithm>
#include <filesystem>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "ramdump/dump_extract.h"
#include "tests/harness/chain_checks.h"

namespace {

namespace fs = std::filesystem;
using Files = std::map<std::string, std::string>;
constexpr size_t P = 4080;  // payload bytes of a unit

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

class InspectStream : public testing::Test {
 protected:
  void TearDown() override { fs::remove_all(dir_); }

  // The built ramdump_inspect, under RB_TEST_WRAPPER (an emulator) when it is set.
  RunResult inspect(const std::string& args) {
    const char* wrapper = getenv("RB_TEST_WRAPPER");
    const int w = system((std::string(wrapper != nullptr ? wrapper : "") +
                          " " RB_BUILD_DIR "/ramdump_inspect " + args + " >" + dir_ + "/out 2>" +
                          dir_ + "/err")
                             .c_str());
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

  std::string dir_ = testing::TempDir() + "readout_XXXXXX";
  const std::string readout_ = (mkdtemp(dir_.data()), dir_ + "/RAMDUMP_OUTPUT"), x_ = dir_ + "/x";
};

// Records across unit boundaries and read-outs that end badly: what list says and exits with,
// what extract writes, and that list's model of the tool's message extraction agrees with the
// real one.
TEST_F(InspectStream, StreamsAndEndings) {
  __android_log_set_logger([](const __android_logger_data*, const char*) {});
  umask(022);
  struct Row {
    std::vector<Rec> recs;
    std::string readout, err;  // readout: "" for the records' own; err: in list's error or detail
    uint64_t end;
    const char* reason;
    int status;
    bool message;  // the tool writes RAMDUMP_MSG.txt whole
  };
  const std::string msg = pattern(2 * P + 9, 9), k = "k" + std::string(P - 81, '\0');
  std::vector<Row> rows;
  // The message header d bytes before a unit's end: each edge of the classes 0-16, 17-39 (which
  // the tool reassembles wrongly) and 40+, and a cut magic.
  // clang-format off
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
  // clang-format on
  for (const Row& row : rows) {
    SCOPED_TRACE(row.err + " " + std::to_string(row.end));
    const std::string readout =
        row.readout.empty() ? readout_units(stream_of(row.recs)) : row.readout;
    write_host_file(readout_, readout);
    RunResult list = inspect("list --json " + readout_);
    EXPECT_EQ(list.status, row.status);
    EXPECT_EQ(list.out.substr(0, list.out.find("\"detail\"")),
              records_json(row.recs) + "{\"offset\": " + std::to_string(row.end) +
                  ", \"reason\": \"" + row.reason + "\", ");
    EXPECT_TRUE(contains(list.out, row.message ? "message\": true}" : "message\": false}"));
    EXPECT_TRUE(contains(list.err + list.out, row.err)) << list.err;

    fs::remove_all(x_);
    EXPECT_EQ(inspect("extract " + readout_ + " " + x_).status, row.status);
    EXPECT_EQ(fs::status(x_).permissions(), fs::perms(0755));  // made under the umask 022
    Files want;
    for (const Rec& r : row.recs) want[want.count(r.name) ? r.name + ".1" : r.name] = r.content;
    EXPECT_EQ(files(x_), want);

    // The tool's own extraction.
    fs::remove_all(x_), fs::create_directories(x_);
    reset_dump_filter_state_for_test();
    extract_ramdump_msg(readout_.c_str(), x_.c_str());
    EXPECT_EQ(read_host_file(x_ + "/RAMDUMP_MSG.txt") == want["RAMDUMP_MSG.txt"] &&
                  fs::exists(x_ + "/RAMDUMP_MSG.txt"),
              row.message);
  }
}

// Usage errors, inputs and outputs that are refused, names that are not safe file names or
// repeat, and what extract does with what is already in DIR (x) and with NAME arguments.
TEST_F(InspectStream, CommandsNamesAndTargets) {
  const std::string readout =
      readout_units(stream_of({{"memory0.bin", "new"}, {"RAMDUMP_OUTPUT", "log"}}));
  write_host_file(readout_, readout);
  // clang-format off
  const std::string &r = readout_, &d = dir_, names = d + "/names", split = d + "/split", real = d + "/real",
                    outside = d + "/outside";
  const std::pair<std::string, std::string> unsafe[] = {  // record name, file name
      {"kernel_log.bin", "kernel_log.bin"}, {"kernel_log.bin", "kernel_log.bin.1"}, {"../../escape", ".._.._escape"},
      {"..", "record_123"}, {"", "record_164"}, {"ttyS0\x01log", "ttyS0_log"},
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
  // clang-format on
  struct {
    char before;  // in x/memory0.bin: f a file, l a link to outside; d: x is a link to real
    std::string args, err;
    int status;
    std::vector<std::string> out = {};
    Files x = {};  // what x holds after
  } rows[] = {
      // clang-format off
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
       "kernel_log.bin.1.1: 1 bytes (\"kernel_log.bin.1\" is taken)\n"}, safe},
      {' ', "list --json " + names, "", 0, {
       "\"kernel_log.bin\", \"size\": 1, \"offset\": 41, \"complete\": true, \"notes\": [\"repeated name\"]}",
       "\"ttyS0\\u0001log\", \"size\": 1, \"offset\": 205, \"complete\": true, \"notes\": [\"unsafe file name\"]}",
       "\"abcdefghijklmnopqrst\", \"size\": 1, \"offset\": 246, \"complete\": true, \"notes\": [\"no terminator\"]}"}},
      {' ', "list " + split, "", 0, {"the tool's extraction stops at stream offset 4063, without RAMDUMP_MSG.txt\n"}},
      {' ', "list " + names, "", 0, {"         164                    1    [unsafe file name]\n",
       "end of the stream at offset 369: record magic"}},
      // clang-format on
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.args + " " + row.before);
    fs::remove_all(x_), fs::remove_all(real), fs::create_directories(real);
    row.before == 'd' ? fs::create_symlink(real, x_) : void(fs::create_directories(x_));
    if (row.before == 'f') write_host_file(x_ + "/memory0.bin", "old");
    if (row.before == 'l') fs::create_symlink(outside, x_ + "/memory0.bin");
    RunResult result = inspect(row.args);
    EXPECT_EQ(result.status, row.status);
    for (const auto& text : row.out) EXPECT_TRUE(contains(result.out, text)) << result.out;
    EXPECT_TRUE(row.err.empty() ? result.err.empty() : contains(result.err, row.err)) << result.err;
    EXPECT_TRUE(row.status != 1 || std::count(result.err.begin(), result.err.end(), '\n') == 1);
    EXPECT_EQ(files(x_), row.x);
  }
  EXPECT_TRUE(files(real).empty() && read_host_file(outside) == "keep");
  EXPECT_TRUE(read_host_file(readout_) == readout);
}

}  // namespace
