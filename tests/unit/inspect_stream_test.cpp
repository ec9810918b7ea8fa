// ramdump_inspect list, extract and strip, run as built on read-outs made here, and its model
// of the tool's message extraction against the real one.
#include <android/log.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

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

// The records part of list --json: offsets from the layout, the last record incomplete when
// its content falls short of its size.
std::string records_json(const std::vector<Rec>& recs) {
  std::string out;
  uint64_t offset = 0;
  for (const Rec& r : recs) {
    const uint64_t size = r.size.value_or(r.content.size());
    const bool complete = size == r.content.size();
    out += std::string(out.empty() ? "" : ",") + "\n  {\"name\": \"" + r.name +
           "\", \"size\": " + std::to_string(size) + ", \"offset\": " + std::to_string(offset) +
           ", \"complete\": " +
           (complete ? "true, \"notes\": []}" : "false, \"notes\": [\"incomplete: ") +
           (complete ? "" : std::to_string(r.content.size()) + " bytes\"]}");
    offset += 40 + r.content.size();
  }
  return "{\"records\": [" + out + (out.empty() ? "" : "\n") + "], \"end\": ";
}

class InspectStream : public testing::Test {
 protected:
  void SetUp() override {
    dir_ = testing::TempDir() + "inspect_stream_XXXXXX";
    ASSERT_NE(mkdtemp(dir_.data()), nullptr);
    readout_ = dir_ + "/RAMDUMP_OUTPUT";
  }
  void TearDown() override { fs::remove_all(dir_); }

  // Runs the built ramdump_inspect, under RB_TEST_WRAPPER (an emulator) when it is set.
  RunResult inspect(const std::string& args) {
    const char* wrapper = getenv("RB_TEST_WRAPPER");
    const std::string err = dir_ + "/stderr",
                      command = std::string(wrapper != nullptr ? wrapper : "") + " " +
                                RB_BUILD_DIR + "/ramdump_inspect " + args;
    FILE* p = popen((command + " 2>" + err).c_str(), "r");
    RunResult r;
    char buf[4096];
    for (size_t n; (n = fread(buf, 1, sizeof(buf), p)) > 0;) r.out.append(buf, n);
    const int w = pclose(p);
    r.status = WIFEXITED(w) ? WEXITSTATUS(w) : 128 + WTERMSIG(w);
    r.err = read_host_file(err);
    return r;
  }

  // Every file below dir, by its path relative to it, with its content or link target.
  std::map<std::string, std::string> files(const std::string& dir) {
    std::map<std::string, std::string> out;
    for (const auto& e : fs::recursive_directory_iterator(dir))
      out[e.path().lexically_relative(dir)] =
          e.is_symlink() ? "-> " + fs::read_symlink(e).string() : read_host_file(e.path());
    return out;
  }

  std::string dir_, readout_;
};

// Records across unit boundaries and read-outs that end badly: what list says and exits with,
// what extract writes, and that strip writes the payloads of the good units.
TEST_F(InspectStream, StreamsAndEndings) {
  struct Row {
    std::vector<Rec> recs;
    std::string readout, err;  // err: a part of list's standard error
    uint64_t end;
    const char* reason;
    int status, strip_status;
  };
  std::vector<Row> rows;
  for (size_t d : {16, 17, 40}) {  // a header d bytes before a unit's end: 0-16, 17-39, 40+
    const std::vector<Rec> recs = {{"memory0.bin", pattern(P - d - 40, 1)},
                                   {"kernel_log.bin", pattern(2 * P + 5, 2)},  // over 3 units
                                   {"RAMDUMP_MSG.txt", pattern(100, 3)}};
    rows.push_back({recs, readout_units(stream_of(recs)), "", 3 * P - d + 185, "bad_magic", 0, 0});
  }
  const Row partial = {rows[0].recs,
                       rows[0].readout + "xyz",
                       "partial unit of 3 bytes at offset 16384",
                       rows[0].end,
                       "bad_magic",
                       1,
                       1};
  const std::vector<Rec> cut = {{"memory0.bin", pattern(5000, 4)},
                                {"trace.bin", pattern(2 * P - 5080, 5), 9000}},
                         huge = {{"memory0.bin", pattern(P - 40, 6), ~0ull}},
                         chain = {{"memory0.bin", pattern(P - 40, 7), 6000}},
                         head = {{"memory0.bin", pattern(P - 60, 8)}};
  std::string bad_chain = readout_units(stream_of(chain) + pattern(1960, 7));
  bad_chain[4096] = 'X';  // chain block magic of unit 1
  const std::string cut_head = stream_of(head) + dump_record("kernel_log.bin", 9, "").substr(0, 20);
  rows.insert(rows.end(),
              {partial,
               {cut, readout_units(stream_of(cut)), "inside a record at stream offset 8160", 8160,
                "cut_record", 1, 0},
               {huge, readout_units(stream_of(huge)), "inside a record at stream offset 4080", 4080,
                "cut_record", 1, 0},
               {chain, bad_chain, "unit 1 at offset 4096 has chain block magic 6f684358", 4080,
                "bad_chain_magic", 1, 1},
               {head, readout_units(cut_head), "inside a record header at stream offset 4060", 4060,
                "cut_header", 1, 0}});
  for (const Row& row : rows) {
    SCOPED_TRACE(row.err + " " + std::to_string(row.end));
    write_host_file(readout_, row.readout);
    RunResult list = inspect("list --json " + readout_);
    EXPECT_EQ(list.status, row.status);
    EXPECT_EQ(list.out.substr(0, list.out.find("\"end\": ") + 7), records_json(row.recs));
    EXPECT_TRUE(contains(list.out, "{\"offset\": " + std::to_string(row.end) + ", \"reason\": \"" +
                                       row.reason + "\""))
        << list.out;
    EXPECT_TRUE(contains(list.err, row.err)) << list.err;

    fs::remove_all(dir_ + "/x");
    EXPECT_EQ(inspect("extract " + readout_ + " " + dir_ + "/x").status, row.status);
    std::map<std::string, std::string> want;
    for (const Rec& r : row.recs) want[r.name] = r.content;
    EXPECT_EQ(files(dir_ + "/x"), want);

    EXPECT_EQ(inspect("strip " + readout_ + " " + dir_ + "/stream").status, row.strip_status);
    std::string payloads;
    for (size_t at = 0; at + 4096 <= row.readout.size() && row.readout.compare(at, 4, "BCho") == 0;
         at += 4096)
      payloads += row.readout.substr(at + 16, P);
    EXPECT_EQ(read_host_file(dir_ + "/stream"), payloads);
  }
}

// Names that are not safe file names, and repeats: extract writes each under a safe name, with
// a suffix where the name is taken, and nowhere but in DIR; list flags them.
TEST_F(InspectStream, UnsafeAndRepeatedNames) {
  const std::vector<Rec> recs = {{"kernel_log.bin", "a"},
                                 {"kernel_log.bin", "b"},
                                 {"../../escape", "c"},
                                 {"..", "d"},
                                 {"", "e"},
                                 {"ttyS0\x01log", "f"},
                                 {"abcdefghijklmnopqrstuvw", "g"},
                                 {"kernel_log.bin.1", "h"},
                                 {"/", "i"}};
  write_host_file(readout_, readout_units(stream_of(recs)));
  RunResult r = inspect("extract " + readout_ + " " + dir_ + "/x");
  EXPECT_EQ(r.status, 0) << r.err;
  const std::map<std::string, std::string> want = {{"kernel_log.bin", "a"},
                                                   {"kernel_log.bin.1", "b"},
                                                   {".._.._escape", "c"},
                                                   {"record_123", "d"},
                                                   {"record_164", "e"},
                                                   {"ttyS0_log", "f"},
                                                   {"abcdefghijklmnopqrst_", "g"},
                                                   {"kernel_log.bin.1.1", "h"},
                                                   {"_", "i"}};
  EXPECT_EQ(files(dir_ + "/x"), want);
  EXPECT_EQ(files(dir_).size(), want.size() + 3);  // the read-out, stderr, x
  EXPECT_FALSE(fs::exists(fs::path(dir_).parent_path() / "escape"));
  EXPECT_TRUE(contains(r.out, "record_123: 1 bytes (the name \"..\" is not a safe file name)\n"));
  EXPECT_TRUE(contains(r.out, "kernel_log.bin.1.1: 1 bytes (\"kernel_log.bin.1\" is taken)\n"));

  RunResult list = inspect("list --json " + readout_);
  EXPECT_EQ(list.status, 0);
  for (const char* record :
       {"{\"name\": \"kernel_log.bin\", \"size\": 1, \"offset\": 41, \"complete\": true, "
        "\"notes\": [\"repeated name\"]}",
        "{\"name\": \"ttyS0\\u0001log\", \"size\": 1, \"offset\": 205, \"complete\": true, "
        "\"notes\": [\"unsafe file name\"]}",
        "{\"name\": \"abcdefghijklmnopqrst\", \"size\": 1, \"offset\": 246, \"complete\": true, "
        "\"notes\": [\"no terminator\"]}"}) {
    EXPECT_TRUE(contains(list.out, record)) << record;
  }
  list = inspect("list " + readout_);
  EXPECT_TRUE(contains(list.out, "         164                    1    [unsafe file name]\n"));
  EXPECT_TRUE(contains(list.out, "end of the stream at offset 369: record magic"));
}

// What extract does with what is already in DIR, and with NAME arguments.
TEST_F(InspectStream, ExtractIntoExistingDirectory) {
  write_host_file(readout_,
                  readout_units(stream_of({{"memory0.bin", "new"}, {"kernel_log.bin", "log"}})));
  const std::string x = dir_ + "/x", real = dir_ + "/real", outside = dir_ + "/outside";
  struct {
    char before;  // in x/memory0.bin: f a file, l a link to outside; d: x is a link to real
    std::string options, names, err;
    int status;
    std::string memory0, kernel_log;  // "" where absent
  } rows[] = {
      {'f', "", "", "x/memory0.bin: exists; --force replaces it", 1, "old", "log"},
      {'f', "--force", "", "", 0, "new", "log"},
      {'l', "--force", "", "exists and is not a regular file", 1, "-> " + outside, "log"},
      {'d', "", "", "x: is a symbolic link, which is not followed", 1, "", ""},
      {' ', "", " kernel_log.bin", "", 0, "", "log"},
      {' ', "", " trace.bin", "no record named \"trace.bin\"", 1, "", ""},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.options + row.names + " " + row.before);
    fs::remove_all(x), fs::remove_all(real), fs::create_directories(real);
    write_host_file(outside, "keep");
    row.before == 'd' ? fs::create_symlink(real, x) : void(fs::create_directories(x));
    if (row.before == 'f') write_host_file(x + "/memory0.bin", "old");
    if (row.before == 'l') fs::create_symlink(outside, x + "/memory0.bin");
    RunResult r = inspect("extract " + row.options + " " + readout_ + " " + x + row.names);
    EXPECT_EQ(r.status, row.status);
    EXPECT_TRUE(contains(r.err, row.err)) << r.err;
    std::map<std::string, std::string> want;
    if (!row.memory0.empty()) want["memory0.bin"] = row.memory0;
    if (!row.kernel_log.empty()) want["kernel_log.bin"] = row.kernel_log;
    EXPECT_EQ(files(x), want);
    EXPECT_EQ(files(real).size(), 0u);
    EXPECT_EQ(read_host_file(outside), "keep");
  }
}

// The model of the tool's message extraction against the real one, for a message record whose
// header starts 0 to 45 bytes (each edge of a class) before the end of a unit's payload; for a
// header 20 bytes before it whose name happens to hold "F1Le" where the tool takes the magic from,
// which the tool gets through; and for an empty message, after which the tool fails and so keeps
// it.
TEST_F(InspectStream, ModelOfTheToolsExtraction) {
  __android_log_set_logger([](const __android_logger_data*, const char*) {});
  const std::string msg = pattern(5000, 9), out = dir_ + "/device/RAMDUMP_MSG.txt";
  fs::create_directories(dir_ + "/device");
  for (size_t d : {0, 16, 17, 39, 40, 45, 46, 47}) {  // 46: "F1Le" in a name, 47: empty
    SCOPED_TRACE(d);
    std::vector<Rec> recs = {{"memory0.bin", pattern(P - d - 40, 1)}, {"RAMDUMP_MSG.txt", msg}};
    if (d == 46) recs = {{"memory0.bin", pattern(P - 60, 1)}, {"kernel_log01F1Le", "k"}, recs[1]};
    if (d == 47) recs = {{"RAMDUMP_MSG.txt", ""}, {"RAMDUMP_MSG.txt", "k", 9000}};
    write_host_file(readout_, readout_units(stream_of(recs)));
    fs::remove(out);
    reset_dump_filter_state_for_test();
    testing::internal::CaptureStderr();
    extract_ramdump_msg(readout_.c_str(), (dir_ + "/device").c_str());
    testing::internal::GetCapturedStderr();
    const bool real = fs::exists(out) && read_host_file(out) == (d == 47 ? "" : msg);
    EXPECT_EQ(real, d < 17 || d > 39);
    EXPECT_EQ(
        contains(inspect("list --json " + readout_).out, "\"device_extracts_message\": true}"),
        real);
  }
}

TEST_F(InspectStream, Usage) {
  const std::string readout =
      readout_units(stream_of({{"memory0.bin", "m"}, {"RAMDUMP_OUTPUT", "r"}}));
  write_host_file(readout_, readout);
  const std::string fifo = dir_ + "/fifo";
  ASSERT_EQ(mkfifo(fifo.c_str(), 0600), 0);
  struct {
    std::string args;
    int status;
    std::string out, err;
  } rows[] = {
      {"list --help", 0, "usage: ramdump_inspect list [--json] OUTPUT\n", ""},
      {"list --bogus " + readout_, 2, "", "unknown option '--bogus'\nusage: ramdump_inspect list"},
      {"extract " + readout_, 2, "", "usage: ramdump_inspect extract"},
      {"list " + dir_ + "/missing", 1, "", ": " + dir_ + "/missing: No such file or directory\n"},
      {"extract " + readout_ + " " + dir_ + "/no/x", 1, "", "/no/x: cannot be created"},
      {"strip " + readout_ + " " + readout_, 1, "", "is the read-out itself\n"},
      {"list " + fifo, 0, "no records", ""},
      {"strip " + readout_ + " " + fifo, 1, "", "a FIFO without a reader\n"},
      {"extract --force " + readout_ + " " + dir_, 1, "memory0.bin: 1 bytes",
       "RAMDUMP_OUTPUT: is the read-out being read"},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.args);
    RunResult r = inspect(row.args);
    EXPECT_EQ(r.status, row.status);
    EXPECT_TRUE(contains(r.out, row.out)) << r.out;
    EXPECT_TRUE(row.err.empty() ? r.err.empty() : contains(r.err, row.err)) << r.err;
    if (row.status == 1) {
      EXPECT_EQ(std::count(r.err.begin(), r.err.end(), '\n'), 1) << r.err;
    }
  }
  EXPECT_EQ(read_host_file(readout_), readout);
}

}  // namespace
