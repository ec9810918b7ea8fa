// A throw-away Android-like root for running the real binaries at the fixed paths they use
// (/data/vendor/ramdump, the misc partition links, /proc/cmdline, /vendor/etc/fstab.*).
//
// The test process first enters a private mount namespace (see device_test_main.cpp), so
// every mount made here disappears with the process even if it is killed. The root is a tmpfs
// with /usr bound read-only (Debian's /bin and /lib are links into /usr), a fresh /proc with a
// fixture file over /proc/cmdline, the misc partition as plain image files at either or both
// device links, the property directory, and optionally /data as a real ext4 file system on a
// loop device whose node is at /dev/block/bootdevice/by-name/userdata and listed in
// /vendor/etc/fstab.<hardware>.
#pragma once

#include <stdint.h>
#include <sys/types.h>

#include <functional>
#include <string>
#include <vector>

struct FakeDeviceConfig {
  bool misc_primary = false;   // image at /dev/block/platform/msm_sdcc.1/by-name/misc
  bool misc_secondary = true;  // image at /dev/block/bootdevice/by-name/misc
  uint64_t misc_bytes = 1 << 20;
  uint8_t misc_fill = 0;  // every byte of a new misc image
  std::string hardware = "rbtest";
  // Written to the file bound over /proc/cmdline.
  std::string cmdline = "console=ttyMSM0 androidboot.hardware=rbtest\n";
  // Nonzero: /data is an ext4 file system of this many bytes (a sparse image).
  uint64_t data_bytes = 0;
  // Extra options for mkfs.ext4, e.g. "-E nodiscard".
  std::string mkfs_options;
  // The fstab line for /data; empty gives the default line naming the userdata node.
  std::string data_fstab_line;
  // "NAME=value" entries added to the environment of every program run().
  std::vector<std::string> env;
};

struct RunResult {
  std::string out;
  std::string err;
  int status = -1;  // exit status, or 128 + signal number
  bool timed_out = false;
  double seconds = 0;   // wall time
  long max_rss_kb = 0;  // peak resident memory of the program
};

class FakeDevice {
 public:
  explicit FakeDevice(const FakeDeviceConfig& config = FakeDeviceConfig());
  ~FakeDevice();
  FakeDevice(const FakeDevice&) = delete;
  FakeDevice& operator=(const FakeDevice&) = delete;

  // Empty when the root was set up; otherwise what went wrong.
  const std::string& setup_error() const { return error_; }

  // The host path of a path inside the root.
  std::string host_path(const std::string& device_path) const;

  void write_file(const std::string& device_path, const std::string& content, mode_t mode = 0644);
  std::string read_file(const std::string& device_path) const;
  bool exists(const std::string& device_path) const;
  void remove(const std::string& device_path);
  void make_dirs(const std::string& device_path);

  void set_property(const std::string& name, const std::string& value);
  std::string property(const std::string& name) const;  // absent reads as ""

  // The system log file of the root, one record per line (see platform/log.h).
  std::string log() const;
  void clear_log();

  // Runs a program of the build directory (copied to /system/bin) chrooted into the root,
  // with argv[0] = program. A run longer than timeout_seconds is killed.
  RunResult run(const std::vector<std::string>& args, const std::string& program = "reserveblocks",
                int timeout_seconds = 600);

  // Called with each line a program run by run() writes to standard error, while it runs
  // (for showing progress live); an empty function turns it off.
  void set_stderr_listener(std::function<void(const std::string&)> listener) {
    stderr_listener_ = std::move(listener);
  }

  // Runs fn in a child chrooted into the root; its result is the exit status, its standard
  // output and error are captured.
  RunResult run_in_root(const std::function<int()>& fn, int timeout_seconds = 60);

  // The host path of a misc image (primary or secondary link), and its bytes.
  std::string misc_host_path(bool primary = false) const;
  std::string misc_bytes(bool primary = false) const;

  // The raw /data device: its host node, raw reads and writes through it, and the physical
  // block of a file's logical block as the file system maps it (FIBMAP), -1 on failure.
  const std::string& data_device() const { return loop_device_; }
  std::string read_raw(uint64_t offset, size_t length) const;
  void write_raw(uint64_t offset, const std::string& bytes) const;
  long map_block(const std::string& device_path, uint32_t logical) const;

  // Fills /data so that statvfs reports exactly this many available bytes (f_bavail *
  // f_bsize), with filler files under /data/filler. Returns false if it cannot.
  bool set_free_space(uint64_t bytes);
  uint64_t free_space() const;

  // Tears everything down; also called by the destructor and on SIGINT/SIGTERM.
  void teardown();

 private:
  bool setup(const FakeDeviceConfig& config);
  bool fail(const std::string& what);
  RunResult wait_child(pid_t pid, const std::string& out_path, const std::string& err_path,
                       int timeout_seconds);
  bool setup_data(const FakeDeviceConfig& config);

  std::string work_;  // host temp directory
  std::string root_;  // work_/root, a tmpfs
  std::string loop_device_;
  std::vector<std::string> mounts_;  // in mount order
  std::string error_;
  bool torn_down_ = false;
  std::vector<std::string> env_;
  std::function<void(const std::string&)> stderr_listener_;
};

// Whether the harness can run here (root), and why not.
bool fake_device_supported(std::string* why);

// Replaces the calling process with a program of the root (path inside the root, argv[0] as
// given), as run() does: under the emulator named by RB_TEST_WRAPPER when that is set (see
// scripts/test-aarch64.sh). Returns only on failure. For tests that start a program
// themselves inside run_in_root().
void exec_program(const std::string& path, char** argv);

// In a test: skips when the harness cannot run here, fails when the root was not set up.
#define REQUIRE_DEVICE(device)                                              \
  do {                                                                      \
    std::string why_unsupported;                                            \
    if (!fake_device_supported(&why_unsupported)) {                         \
      GTEST_SKIP() << why_unsupported;                                      \
    }                                                                       \
    ASSERT_EQ((device).setup_error(), "") << "fake device root not set up"; \
  } while (0)

// Paths of the fake device.
#define USERDATA_DEVICE "/dev/block/bootdevice/by-name/userdata"
#define MISC_DEVICE "/dev/block/bootdevice/by-name/misc"

// The build directory holding the programs under test.
std::string build_dir();

// Reads a whole host file, "" when absent.
std::string read_host_file(const std::string& path);
void write_host_file(const std::string& path, const std::string& content);

// Little-endian helpers for checking raw bytes.
uint32_t le32_at(const std::string& bytes, size_t offset);
uint16_t le16_at(const std::string& bytes, size_t offset);
uint64_t le64_at(const std::string& bytes, size_t offset);
