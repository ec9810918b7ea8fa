// A throw-away Android-like root for the real binaries: a tmpfs with /usr bound read-only, /proc
// with a fixture /proc/cmdline, a zeroed 1 MiB misc image, the property directory, the programs
// in /system/bin, and optionally /data as ext4 on a self-detaching loop device. Its mounts live
// in the process's private mount namespace and vanish with it.
#pragma once

#include <stdint.h>
#include <sys/types.h>

#include <functional>
#include <string>
#include <vector>

#define USERDATA_DEVICE "/dev/block/bootdevice/by-name/userdata"
#define MISC_DEVICE "/dev/block/bootdevice/by-name/misc"

std::string read_host_file(const std::string& path);  // "" when absent
void write_host_file(const std::string& path, const std::string& content);

uint32_t le32_at(const std::string& bytes, size_t offset);

inline bool contains(const std::string& text, const std::string& part) {
  return text.find(part) != std::string::npos;
}

struct FakeDeviceConfig {
  FakeDeviceConfig(uint64_t data_bytes = 0) : data_bytes(data_bytes) {}
  std::string cmdline = "console=ttyS0 androidboot.hardware=rbtest\n";
  uint64_t data_bytes;       // nonzero: /data is a (sparse) ext4 image of this size
  std::string mkfs_options;  // extra options for mkfs.ext4
  std::string fstab =        // /vendor/etc/fstab.rbtest
      USERDATA_DEVICE " /data ext4 noatime,nosuid,nodev,barrier=1 wait,check,encryptable=footer\n";
};

struct RunResult {
  std::string out, err;
  int status = -1;  // exit status, or 128 + signal number
  bool timed_out = false;
  double seconds = 0;  // wall time
  long max_rss_kb = 0;
};

class FakeDevice {
 public:
  explicit FakeDevice(const FakeDeviceConfig& config = FakeDeviceConfig());
  ~FakeDevice();
  FakeDevice(const FakeDevice&) = delete;
  FakeDevice& operator=(const FakeDevice&) = delete;

  const std::string& setup_error() const { return error_; }

  std::string host_path(const std::string& device_path) const { return root_ + device_path; }
  void write_file(const std::string& device_path, const std::string& content, mode_t mode = 0644);
  std::string read_file(const std::string& path) const { return read_host_file(host_path(path)); }
  bool exists(const std::string& device_path) const;
  void remove(const std::string& device_path);  // a file or an empty directory

  void set_property(const std::string& name, const std::string& value) {
    write_file("/dev/__properties__/" + name, value);
  }
  std::string property(const std::string& name) const {  // absent reads as ""
    return read_file("/dev/__properties__/" + name);
  }
  // The system log (platform/log.h), one record per line: the programs only append to it.
  std::string log() const { return read_file("/dev/__log__"); }
  void clear_log() { write_file("/dev/__log__", "", 0666); }

  // Runs /system/bin/<program> chrooted into the root (argv[0] = program), under the program
  // RB_TEST_WRAPPER names when that is set; a run longer than timeout_seconds is killed.
  RunResult run(const std::vector<std::string>& args, const std::string& program = "reserveblocks",
                int timeout_seconds = 600);
  // Runs fn in a child chrooted into the root; its result is the exit status.
  RunResult run_in_root(const std::function<int()>& fn, int timeout_seconds = 60);
  // Gets each line a run writes to standard error while it runs.
  void set_stderr_listener(std::function<void(const std::string&)> listener) {
    stderr_listener_ = std::move(listener);
  }

  std::string misc_host_path() const { return host_path(MISC_DEVICE); }
  std::string misc_bytes() const { return read_file(MISC_DEVICE); }

  // Mounts a new sparse ext4 file system of `bytes` at mount_point on a loop device and makes
  // the device's node at node (both in the root); returns its host node. Throws when it cannot.
  std::string mount_ext4(uint64_t bytes, const std::string& mount_point, const std::string& node,
                         const std::string& mkfs_options = "");

  // The raw /data device (host node).
  const std::string& data_device() const { return loop_device_; }
  void write_raw(uint64_t offset, const std::string& bytes) const;

  // Fills /data/filler until exactly this many bytes are available; false if it cannot.
  bool set_free_space(uint64_t bytes);
  uint64_t free_space() const;

 private:
  void setup(const FakeDeviceConfig& config);
  void teardown();

  std::string work_;  // host temporary directory
  std::string root_;  // work_/root, a tmpfs
  bool root_mounted_ = false;
  std::string loop_device_, error_;
  std::function<void(const std::string&)> stderr_listener_;
};

bool fake_device_supported(std::string* why);

// So that the fake devices' mounts never reach the host. False, after perror(who), on failure.
bool enter_private_mount_namespace(const char* who);

// In a test: skips when the harness cannot run here, fails when the root was not set up.
#define REQUIRE_DEVICE(device)                                              \
  do {                                                                      \
    if (std::string why; !fake_device_supported(&why)) GTEST_SKIP() << why; \
    ASSERT_EQ((device).setup_error(), "") << "fake device root not set up"; \
  } while (0)
