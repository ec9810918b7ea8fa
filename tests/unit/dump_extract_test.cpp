#include "ramdump/dump_extract.h"

#include <android/log.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <string.h>

#include <filesystem>
#include <string>

#include "ramdump/chain_format.h"
#include "tests/harness/chain_checks.h"

namespace {

constexpr size_t kUnit = 4096;
constexpr size_t kPayload = kUnit - CHAIN_BLOCK_HEADER_SIZE;

std::string logged;  // "<I|E> <message>" per record

void capture_log(const __android_logger_data* data, const char* message) {
  logged += std::string(data->priority == ANDROID_LOG_ERROR ? "E " : "I ") + message;
}

std::string pattern(size_t n, unsigned seed) {
  std::string s(n, '\0');
  for (size_t i = 0; i < n; ++i) s[i] = static_cast<char>((i * 7 + seed) & 0xFF);
  return s;
}

std::string record(const std::string& name, const std::string& content) {
  return dump_record(name, content.size(), content);
}

class DumpExtract : public testing::Test {
 protected:
  void SetUp() override {
    __android_log_set_logger(capture_log);
    dir_ = testing::TempDir() + "dump_extract_XXXXXX";
    ASSERT_NE(mkdtemp(dir_.data()), nullptr);
  }
  void TearDown() override {
    __android_log_set_logger(__android_log_stderr_logger);
    std::filesystem::remove_all(dir_);
  }

  // Returns standard error; *message is the message file, "(none)" when there is none.
  std::string extract(const std::string& readout, std::string* message) {
    reset_dump_filter_state_for_test();
    logged.clear();
    const std::string path = dir_ + "/RAMDUMP_OUTPUT", msg = dir_ + "/RAMDUMP_MSG.txt";
    write_host_file(path, readout);
    std::filesystem::remove(msg);
    testing::internal::CaptureStderr();
    EXPECT_EQ(extract_ramdump_msg(path.c_str(), dir_.c_str()), 0);
    *message = std::filesystem::exists(msg) ? read_host_file(msg) : "(none)";
    return testing::internal::GetCapturedStderr();
  }

  std::string dir_;
};

TEST_F(DumpExtract, Endings) {
  const std::string msg = pattern(6000, 7),
                    two_units = readout_units(record("RAMDUMP_MSG.txt", msg));
  const std::string damaged = two_units.substr(0, kUnit) + "xV4\x12" + two_units.substr(kUnit + 4);
  const std::string empty_wanted = record("RAMDUMP_MSG.txt", "");
  const std::string filler = record("KLOG", pattern(kPayload - 80, 5));  // ends a payload
  const std::string tail = record("RAMDUMP_MSG.txt", "msg") + record("FW", pattern(kPayload, 9));
  const std::string huger = dump_record("RAMDUMP_MSG.txt", ~0ull, "k") + tail;
  std::string swallowed = huger.substr(DUMP_FILE_RECORD_SIZE);  // to the end of the last unit
  swallowed.resize((huger.size() + kPayload - 1) / kPayload * kPayload - DUMP_FILE_RECORD_SIZE);

  const std::string found = "I Found file 'RAMDUMP_MSG.txt', size ";
  struct {
    std::string readout, err, message, log;
  } cases[] = {
      // A zero-length write never reports success: an empty wanted record fails once data follows.
      {readout_units(filler + empty_wanted + tail), "Could not write 0 bytes", "", found + "0\n"},
      {readout_units(filler + empty_wanted), "", "", found + "0\n"},
      {damaged, "* bad block header magic, got 12345678, expecting 6f684342\n",
       msg.substr(0, kPayload - 40), found + "6000\n"},
      {two_units.substr(0, kUnit + 1000), "", msg.substr(0, kPayload - 40),  // partial unit unread
       found + "6000\n"},
      // Sizes beyond the data swallow the rest, even past the signed range.
      {readout_units(dump_record("KLOG", 1ull << 40, "k") + tail), "", "(none)", ""},
      {readout_units(huger), "", swallowed, found + "18446744073709551615\n"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(&c - cases);
    std::string message;
    EXPECT_EQ(extract(c.readout, &message), c.err);
    EXPECT_EQ(message, c.message);
    EXPECT_EQ(logged, c.log);
  }
  testing::internal::CaptureStderr();
  EXPECT_EQ(extract_ramdump_msg("/nonexistent/RAMDUMP_OUTPUT", dir_.c_str()), 0);
  EXPECT_EQ(testing::internal::GetCapturedStderr(),
            "Unable to open /nonexistent/RAMDUMP_OUTPUT for reading\n");
}

// The path is built for every record; one over 4096 characters ends the process, never cut short.
TEST_F(DumpExtract, OutputPathLimit) {
  const std::string stream = record("FW_DIAG", ""), fits(4096 - strlen("/FW_DIAG"), 'd');
  FILE* out = nullptr;
  auto filter = [&](const std::string& out_dir) {
    reset_dump_filter_state_for_test();
    __android_log_set_logger(__android_log_stderr_logger);
    return process_data_filtered(reinterpret_cast<const uint8_t*>(stream.data()),
                                 DUMP_FILE_RECORD_SIZE, &out, "RAMDUMP_MSG.txt", out_dir.c_str());
  };
  EXPECT_EQ(filter(fits), 0);
  EXPECT_DEATH(filter(fits + "d"), "longer than 4096 characters");
}

}  // namespace
