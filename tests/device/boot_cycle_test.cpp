// The automatic cycle at full size, as the real binary in the fake device root, with the firmware
// simulator storing the dump. The boot entry's other paths are rows of the fault table.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <string>
#include <utility>
#include <vector>

#include "tests/harness/chain_checks.h"
#include "tests/harness/fake_device.h"

namespace {

const char kReserved[] = "/data/vendor/ramdump/RAMDUMP_RESERVED";
const char kOutDir[] = "/data/vendor/ramdump/apq/00";
const char kOutput[] = "/data/vendor/ramdump/apq/00/RAMDUMP_OUTPUT";
const char kMessage[] = "/data/vendor/ramdump/apq/00/RAMDUMP_MSG.txt";
const char kNoDump[] = "E reserveblocks: No ramdump found, exiting\\n\n";
const uint64_t kGiB = 1ull << 30;
using Files = std::vector<std::pair<std::string, std::string>>;

mode_t mode_of(const FakeDevice& device, const std::string& path) {
  struct stat st;
  return stat(device.host_path(path).c_str(), &st) == 0 ? st.st_mode & 07777 : 0;
}

// The simulated firmware stores the files as a dump.
void simulate_crash(FakeDevice& device, const Files& files) {
  std::vector<std::string> args = {MISC_DEVICE, USERDATA_DEVICE};
  for (const auto& file : files) {
    device.write_file(file.first, file.second);
    args.push_back(file.first);
  }
  RunResult r = device.run(args, "firmware_sim");
  ASSERT_EQ(r.status, 0) << r.err;
}

// Boots at full size: create and arm at exactly 10 GiB free; collect and re-arm; find nothing.
TEST(AutoCycle, FullCrashCycleAtFullSize) {
  FakeDevice device(16 * kGiB);
  REQUIRE_DEVICE(device);
  const uint32_t kCount = 1081344;  // 4,429,185,024 / 4096
  ASSERT_EQ(device.run({"-e"}).status, 0);

  ASSERT_TRUE(device.set_free_space(10737418240ull));
  RunResult r = device.run({"-a", "-i", "1234abcd"});
  EXPECT_EQ(r.status, 255);  // a first arming reports failure: there was nothing to collect
  EXPECT_EQ(device.property("debug.kvo.kvdump"), "fail");
  EXPECT_EQ(mode_of(device, kReserved), 0744u);
  EXPECT_EQ(std::filesystem::file_size(device.host_path(kReserved)), 4429185024u);
  const std::vector<long> blocks = map_file(device, kReserved, kCount);
  EXPECT_EQ(stored_ibh(device), make_ibh(blocks[0], 4096, kCount, 0x1234abcd, 1));
  EXPECT_EQ(device.misc_bytes().substr(3136, 4), std::string(4, '\xFF'));
  EXPECT_EQ(verify_chain(device, blocks, 0x1234abcd, false), "");
  std::filesystem::remove_all(device.host_path("/data/filler"));

  std::string message = "Kernel panic - not syncing: Fatal exception\n";
  for (int i = 0; i < 500; ++i) message += "[" + std::to_string(i) + "] call trace line\n";
  std::string big(3 << 20, '\0');
  for (size_t i = 0; i < big.size(); ++i) big[i] = static_cast<char>(i * 7 + (i >> 12));
  const Files files = {{"/tmp/kernel_log.bin", std::string(12345, 't')},
                       {"/tmp/RAMDUMP_MSG.txt", message},
                       {"/tmp/memory0.bin", big}};
  simulate_crash(device, files);
  EXPECT_EQ(stored_ibh(device), make_ibh(blocks[0], 4096, kCount, 0x1234abcd, 3));
  std::vector<size_t> stored;  // hashes of the blocks as the firmware left them
  std::ifstream raw(device.data_device(), std::ios::binary);
  std::string block(4096, '\0');
  for (long b : blocks) {
    raw.seekg(static_cast<std::streamoff>(b) * 4096).read(&block[0], 4096);
    stored.push_back(std::hash<std::string>()(block));
  }

  r = device.run({"-a", "-i", "99999999"});
  EXPECT_EQ(r.status, 0) << device.log();
  EXPECT_EQ(device.property("debug.kvo.kvdump"), "done");
  EXPECT_EQ(device.property("debug.kvo.ramdump_new_directory"), kOutDir);
  EXPECT_EQ(device.read_file(kMessage), message);
  EXPECT_EQ(stored_ibh(device), make_ibh(blocks[0], 4096, kCount, 0x1234abcd, 1));
  EXPECT_EQ(verify_chain(device, blocks, 0x1234abcd, false), "");

  ASSERT_EQ(std::filesystem::file_size(device.host_path(kOutput)), 4429185024u);
  std::ifstream out(device.host_path(kOutput), std::ios::binary);
  size_t first_bad = kCount;
  for (size_t i = 0; i < kCount && first_bad == kCount; ++i) {
    if (!out.read(&block[0], 4096) || std::hash<std::string>()(block) != stored[i]) first_bad = i;
  }
  EXPECT_EQ(first_bad, kCount) << "first output block that differs";

  device.clear_log();
  r = device.run({"-a"});
  EXPECT_EQ(r.status, 255);
  EXPECT_EQ(device.property("debug.kvo.kvdump"), "fail");
  EXPECT_EQ(device.property("debug.kvo.ramdump_new_directory"), kOutDir);
  EXPECT_TRUE(contains(tool_log(device), kNoDump)) << device.log();
  EXPECT_EQ(device.read_file(kMessage), message);  // the last dump stays until the next one
}

}  // namespace
