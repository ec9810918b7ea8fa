#include "ramdump/dump_extract.h"

#include <android/log.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <utility>
#include <vector>

#include "ramdump/chain_format.h"
#include "ramdump/le_bytes.h"

namespace {

constexpr size_t kUnit = 4096;
constexpr size_t kPayload = kUnit - CHAIN_BLOCK_HEADER_SIZE;
constexpr uint64_t kHuge = 1ull << 40;

using bytes = std::vector<uint8_t>;

std::vector<std::pair<int, std::string>>& log_records() {
  static std::vector<std::pair<int, std::string>> records;
  return records;
}

void capture_log(const struct __android_logger_data* data, const char* message) {
  log_records().emplace_back(data->priority, message);
}

size_t count_logged(int priority, const std::string& prefix) {
  size_t n = 0;
  for (const auto& [p, m] : log_records()) n += p == priority && m.rfind(prefix, 0) == 0;
  return n;
}

std::string pattern(size_t n, unsigned seed) {
  std::string s(n, '\0');
  for (size_t i = 0; i < n; ++i) s[i] = static_cast<char>((i * 7 + seed) & 0xFF);
  return s;
}

// One record of the dump stream. The name is copied byte for byte into the 20-byte field, so
// a name of 20 characters has no terminator. The content may be shorter than size.
void add_record(bytes& stream, const std::string& name, uint64_t size, const std::string& content) {
  dump_file_record r = {};
  r.magic = DUMP_FILE_MAGIC;
  memcpy(r.name, name.data(), std::min(name.size(), DUMP_FILE_NAME_SIZE));
  r.size = size;
  r.reserved = 0x5555;
  uint8_t header[DUMP_FILE_RECORD_SIZE];
  encode_dump_file_record(r, header);
  stream.insert(stream.end(), header, header + sizeof(header));
  stream.insert(stream.end(), content.begin(), content.end());
}

void add_record(bytes& stream, const std::string& name, const std::string& content) {
  add_record(stream, name, content.size(), content);
}

// The stream padded with zeros to whole payloads, as the arming leaves them.
bytes padded(bytes stream) {
  stream.resize((stream.size() + kPayload - 1) / kPayload * kPayload, 0);
  return stream;
}

// A read-out: each payload behind its chain block header.
bytes to_units(const bytes& stream) {
  bytes p = padded(stream);
  bytes out;
  for (size_t off = 0; off < p.size(); off += kPayload) {
    uint8_t header[CHAIN_BLOCK_HEADER_SIZE];
    encode_chain_block_header(
        {CHAIN_BLOCK_MAGIC, static_cast<uint32_t>(off / kPayload + 1), 0, 1, 0x01020304}, header);
    out.insert(out.end(), header, header + sizeof(header));
    out.insert(out.end(), p.begin() + off, p.begin() + off + kPayload);
  }
  return out;
}

class DumpExtract : public testing::Test {
 protected:
  void SetUp() override { start_case(); }
  void TearDown() override { finish_case(); }

  // Table rows each get a fresh filter, log, and directory.
  void next_case() {
    finish_case();
    start_case();
  }

  void start_case() {
    reset_dump_filter_state_for_test();
    log_records().clear();
    __android_log_set_logger(capture_log);
    const char* tmp = getenv("TMPDIR");
    std::string tmpl = std::string(tmp != nullptr ? tmp : "/tmp") + "/dump_extract_XXXXXX";
    ASSERT_NE(mkdtemp(tmpl.data()), nullptr);
    dir_ = tmpl;
    out_dir_ = dir_ + "/out";
    readout_ = dir_ + "/RAMDUMP_OUTPUT";
    ASSERT_EQ(mkdir(out_dir_.c_str(), 0755), 0);
  }

  void finish_case() {
    __android_log_set_logger(__android_log_stderr_logger);
    if (!dir_.empty()) std::filesystem::remove_all(dir_);
    dir_.clear();
  }

  // Runs the extraction over the read-out and returns what it printed on standard error.
  std::string extract(const bytes& readout) {
    std::ofstream(readout_, std::ios::binary)
        .write(reinterpret_cast<const char*>(readout.data()),
               static_cast<std::streamsize>(readout.size()));
    testing::internal::CaptureStderr();
    EXPECT_EQ(extract_ramdump_msg(readout_.c_str(), out_dir_.c_str()), 0);
    return testing::internal::GetCapturedStderr();
  }

  // The message file's content, or false when there is none.
  bool message(std::string* content) {
    std::ifstream f(out_dir_ + "/RAMDUMP_MSG.txt", std::ios::binary);
    if (!f) return false;
    content->assign(std::istreambuf_iterator<char>(f), std::istreambuf_iterator<char>());
    return true;
  }

  std::string dir_, out_dir_, readout_;
};

const char kBadMagicZero[] = "* bad magic, got 00000000, expecting 654c3146\n";

// Record headers placed so that they straddle unit boundaries: `first` bytes of a header at
// the end of the first unit's payload, `second` at the end of the second one's (0: the header
// starts a payload). The carried bytes come from the end of the unit as read, so only splits
// of up to 16 bytes come out right; the others end the extraction at a bad record magic.
TEST_F(DumpExtract, RecordHeadersAcrossUnits) {
  struct {
    size_t first, second;
    bool reassembled;
  } cases[] = {
      {0, 0, true},   {7, 5, true},   {12, 16, true}, {1, 1, true},
      {0, 17, false}, {9, 39, false}, {17, 0, false}, {16, 25, false},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(testing::Message() << "split " << c.first << "/" << c.second);
    next_case();
    const std::string msg = pattern(5000, 3);
    bytes stream;
    add_record(stream, "PMIC_RESET_REASONS", pattern(kPayload - c.first - 40, 1));
    add_record(stream, "KERNEL_LOG_BUFFER", pattern(kPayload + c.first - c.second - 40, 2));
    ASSERT_EQ(stream.size(), 2 * kPayload - c.second);
    add_record(stream, "RAMDUMP_MSG.txt", msg);
    add_record(stream, "TZ_DIAG", pattern(100, 4));

    EXPECT_EQ(extract(to_units(stream)), "");
    std::string got;
    size_t bad_magic = count_logged(ANDROID_LOG_ERROR, "* bad magic, got ");
    if (c.reassembled) {
      ASSERT_TRUE(message(&got));
      EXPECT_EQ(got, msg);
      EXPECT_EQ(count_logged(ANDROID_LOG_INFO, "Found file 'RAMDUMP_MSG.txt', size 5000\n"), 1u);
      EXPECT_EQ(bad_magic, 1u);
      EXPECT_EQ(count_logged(ANDROID_LOG_ERROR, kBadMagicZero), 1u);
    } else {
      EXPECT_FALSE(message(&got));
      EXPECT_EQ(count_logged(ANDROID_LOG_INFO, "Found file"), 0u);
      EXPECT_EQ(bad_magic, 1u);
      EXPECT_EQ(count_logged(ANDROID_LOG_ERROR, kBadMagicZero), 0u);
    }
  }
}

// A zero-length item is never reported as written, so a wanted record of size 0 fails as soon
// as any data follows it, whether in the same payload or in the next unit.
TEST_F(DumpExtract, EmptyWantedRecord) {
  struct {
    const char* what;
    size_t filler;  // content bytes of a record in front of the wanted one
    bool more_data;
  } cases[] = {
      {"data follows in the same payload", 10, true},
      {"data follows in the next unit", kPayload - 80, true},
      {"nothing follows", kPayload - 80, false},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.what);
    next_case();
    bytes stream;
    add_record(stream, "KERNEL_LOG_BUFFER", pattern(c.filler, 5));
    add_record(stream, "RAMDUMP_MSG.txt", "");
    bytes readout = to_units(stream);
    if (c.more_data) {
      add_record(stream, "TZ_DIAG", pattern(50, 6));
      readout = to_units(stream);
    }

    std::string err = extract(readout);
    EXPECT_EQ(err, c.more_data ? "Could not write 0 bytes" : "");
    EXPECT_EQ(count_logged(ANDROID_LOG_INFO, "Found file 'RAMDUMP_MSG.txt', size 0\n"), 1u);
    EXPECT_EQ(count_logged(ANDROID_LOG_ERROR, "* bad magic"), 0u);
    std::string got = "unset";
    ASSERT_TRUE(message(&got));
    EXPECT_EQ(got, "");
  }
}

TEST_F(DumpExtract, UnitsThatEndTheExtraction) {
  const std::string msg = pattern(6000, 7);
  bytes stream;
  add_record(stream, "RAMDUMP_MSG.txt", msg);

  // The second unit's chain block header is damaged: the content of the first one stays.
  bytes readout = to_units(stream);
  put_le32(readout.data() + kUnit, 0x12345678);
  EXPECT_EQ(extract(readout), "* bad block header magic, got 12345678, expecting 6f684342\n");
  std::string got;
  ASSERT_TRUE(message(&got));
  EXPECT_EQ(got, msg.substr(0, kPayload - 40));
  EXPECT_EQ(count_logged(ANDROID_LOG_ERROR, "* bad magic"), 0u);

  // A partial unit at the end of the read-out is never looked at, not even its magic.
  next_case();
  stream.clear();
  add_record(stream, "RAMDUMP_MSG.txt", pattern(100, 8));
  readout = to_units(stream);
  readout.insert(readout.end(), kUnit - 1, 0xFF);
  EXPECT_EQ(extract(readout), "");
  ASSERT_TRUE(message(&got));
  EXPECT_EQ(got, pattern(100, 8));
  EXPECT_EQ(count_logged(ANDROID_LOG_ERROR, kBadMagicZero), 1u);
}

TEST(DumpExtractMissing, UnreadableReadOut) {
  testing::internal::CaptureStderr();
  EXPECT_EQ(extract_ramdump_msg("/nonexistent/RAMDUMP_OUTPUT", "/nonexistent"), 0);
  EXPECT_EQ(testing::internal::GetCapturedStderr(),
            "Unable to open /nonexistent/RAMDUMP_OUTPUT for reading\n");
}

// Record headers the firmware should not write: names that fill the whole field and sizes
// beyond the data. None of them may take the extraction outside its buffers.
TEST_F(DumpExtract, MalformedRecords) {
  enum expectation { MESSAGE, REST_OF_STREAM, NOTHING };
  const std::string msg = pattern(300, 9);
  struct {
    const char* what;
    std::string name;
    uint64_t size;
    std::string wanted_name;
    expectation expected;
  } cases[] = {
      {"name without terminator", "ABCDEFGHIJKLMNOPQRST", 64, "RAMDUMP_MSG.txt", MESSAGE},
      {"wanted name as a prefix", "RAMDUMP_MSG.txtXXXXX", 64, "RAMDUMP_MSG.txt", MESSAGE},
      {"huge size before the wanted record", "KERNEL_LOG_BUFFER", kHuge, "RAMDUMP_MSG.txt",
       NOTHING},
      {"huge size of the wanted record", "RAMDUMP_MSG.txt", kHuge, "", REST_OF_STREAM},
      {"size beyond the signed range", "RAMDUMP_MSG.txt", ~0ull, "", REST_OF_STREAM},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.what);
    next_case();
    bytes stream;
    add_record(stream, c.name, c.size, pattern(64, 10));
    if (!c.wanted_name.empty()) add_record(stream, c.wanted_name, msg);
    // Enough for three units, so that an oversized record runs across unit boundaries.
    add_record(stream, "TZ_DIAG", pattern(2 * kPayload, 11));

    EXPECT_EQ(extract(to_units(stream)), "");
    std::string got;
    switch (c.expected) {
      case MESSAGE:
        ASSERT_TRUE(message(&got));
        EXPECT_EQ(got, msg);
        EXPECT_EQ(count_logged(ANDROID_LOG_INFO, "Found file"), 1u);
        break;
      case REST_OF_STREAM: {
        ASSERT_TRUE(message(&got));
        bytes p = padded(stream);
        EXPECT_EQ(got, std::string(p.begin() + DUMP_FILE_RECORD_SIZE, p.end()));
        EXPECT_EQ(count_logged(ANDROID_LOG_ERROR, "* bad magic"), 0u);
        break;
      }
      case NOTHING:
        EXPECT_FALSE(message(&got));
        EXPECT_EQ(count_logged(ANDROID_LOG_ERROR, "* bad magic"), 0u);
        break;
    }
  }
}

// The output path is built for every record; one that does not fit its 4097-byte buffer ends
// the process instead of being cut short.
TEST_F(DumpExtract, OutputPathLimit) {
  bytes stream;
  add_record(stream, "TZ_DIAG", 0, "");
  const std::string fits(4096 - 1 - strlen("TZ_DIAG"), 'd');
  FILE* out = nullptr;
  EXPECT_EQ(process_data_filtered(stream.data(), static_cast<int64_t>(stream.size()), &out,
                                  "RAMDUMP_MSG.txt", fits.c_str()),
            0);
  EXPECT_EQ(out, nullptr);

  reset_dump_filter_state_for_test();
  const std::string too_long = fits + "d";
  EXPECT_DEATH(
      {
        __android_log_set_logger(__android_log_stderr_logger);
        process_data_filtered(stream.data(), static_cast<int64_t>(stream.size()), &out,
                              "RAMDUMP_MSG.txt", too_long.c_str());
      },
      "longer than 4096 characters");
}

}  // namespace
