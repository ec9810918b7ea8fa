#include "tests/harness/fake_device.h"

#include <fcntl.h>
#include <sched.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mount.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <sys/sysmacros.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <stdexcept>

namespace fs = std::filesystem;

namespace {

void check(bool ok, const std::string& what) {
  if (!ok) throw std::runtime_error(what + ": " + strerror(errno));
}

}  // namespace

bool fake_device_supported(std::string* why) {
  if (geteuid() == 0) return true;
  *why = "the fake device root needs root (mount namespaces, loop devices, chroot)";
  return false;
}

bool enter_private_mount_namespace(const char* who) {
  if (unshare(CLONE_NEWNS) != 0 || mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr)) {
    perror(who);
    return false;
  }
  return true;
}

std::string read_host_file(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  std::ostringstream bytes;
  bytes << in.rdbuf();
  return bytes.str();
}

void write_host_file(const std::string& path, const std::string& content) {
  std::ofstream(path, std::ios::binary) << content;
}

uint32_t le32_at(const std::string& b, size_t o) {
  uint32_t v = 0;
  for (int i = 3; i >= 0; --i) v = v << 8 | static_cast<uint8_t>(b.at(o + i));
  return v;
}

FakeDevice::FakeDevice(const FakeDeviceConfig& config) {
  if (!fake_device_supported(&error_)) return;
  try {
    setup(config);
  } catch (const std::exception& e) {
    error_ = e.what();
    teardown();
  }
}

FakeDevice::~FakeDevice() { teardown(); }

void FakeDevice::setup(const FakeDeviceConfig& config) {
  char tmpl[] = "/tmp/rb-device.XXXXXX";
  check(mkdtemp(tmpl) != nullptr, "mkdtemp");
  work_ = tmpl;
  root_ = work_ + "/root";
  fs::create_directory(root_);
  check(mount("rbroot", root_.c_str(), "tmpfs", 0, "mode=0755") == 0, "mount tmpfs");
  root_mounted_ = true;
  for (const char* dir : {"/usr", "/proc", "/dev/__properties__", "/dev/block/bootdevice/by-name",
                          "/vendor/etc", "/system/bin", "/data", "/tmp"}) {
    fs::create_directories(host_path(dir));
  }
  const std::string usr = host_path("/usr"), proc = host_path("/proc");
  check(mount("/usr", usr.c_str(), nullptr, MS_BIND | MS_REC, nullptr) == 0 &&
            mount(nullptr, usr.c_str(), nullptr, MS_REMOUNT | MS_BIND | MS_RDONLY, nullptr) == 0,
        "bind /usr read-only");
  for (std::string link : {"bin", "lib", "lib64", "lib32", "libx32"}) {  // Debian's merged /usr
    if (fs::exists("/usr/" + link)) fs::create_symlink("usr/" + link, host_path("/" + link));
  }
  write_host_file(work_ + "/cmdline", config.cmdline);
  check(mount("proc", proc.c_str(), "proc", MS_NOSUID | MS_NODEV | MS_NOEXEC, nullptr) == 0 &&
            mount((work_ + "/cmdline").c_str(), (proc + "/cmdline").c_str(), nullptr, MS_BIND,
                  nullptr) == 0,
        "mount /proc with a fixture /proc/cmdline");
  check(mknod(host_path("/dev/null").c_str(), S_IFCHR | 0666, makedev(1, 3)) == 0, "/dev/null");
  clear_log();
  write_host_file(misc_host_path(), std::string(1 << 20, '\0'));
  for (const char* program : {"reserveblocks", "fstab_dump", "firmware_sim"}) {
    const std::string built = std::string(RB_BUILD_DIR) + "/" + program;
    if (fs::exists(built)) fs::copy_file(built, host_path("/system/bin/") + program);
  }
  write_file("/vendor/etc/fstab.rbtest", config.fstab);
  if (config.data_bytes != 0) {
    loop_device_ = mount_ext4(config.data_bytes, "/data", USERDATA_DEVICE, config.mkfs_options);
  }
  fs::create_directories(host_path("/data/vendor/ramdump"));
}

std::string FakeDevice::mount_ext4(uint64_t bytes, const std::string& mount_point,
                                   const std::string& node, const std::string& mkfs_options) {
  const std::string image = work_ + "/" + fs::path(mount_point).filename().string() + ".img",
                    dir = host_path(mount_point);
  fs::create_directories(dir);
  write_host_file(image, "");
  fs::resize_file(image, bytes);
  // No blocks reserved for root, so that free space is what statvfs reports as available.
  const std::string mkfs = "mkfs.ext4 -q -F -m 0 -b 4096 " + mkfs_options + " " + image;
  if (system((mkfs + " >/dev/null 2>&1").c_str()) != 0) throw std::runtime_error(mkfs);
  // mount(8) attaches a loop device that detaches itself once unmounted; the image is removed
  // at once, so that nothing is left behind if we are killed.
  if (system(("mount -o loop,noatime " + image + " " + dir + " && rm " + image).c_str()) != 0) {
    throw std::runtime_error("mount ext4 on a loop device at " + mount_point);
  }
  struct stat st;
  check(stat(dir.c_str(), &st) == 0, "stat " + mount_point);
  check(mknod(host_path(node).c_str(), S_IFBLK | 0600, st.st_dev) == 0, "node " + node);
  return "/dev/loop" + std::to_string(minor(st.st_dev));
}

void FakeDevice::teardown() {
  // Detaching the root detaches every mount below it; the loop device then detaches itself.
  // Should that fail, the work directory stays rather than be removed through a mount.
  if (root_mounted_ && umount2(root_.c_str(), MNT_DETACH) != 0) return;
  root_mounted_ = false;
  std::error_code ignored;
  if (!work_.empty()) fs::remove_all(work_, ignored);
  work_.clear();
}

void FakeDevice::write_file(const std::string& device_path, const std::string& content,
                            mode_t mode) {
  const fs::path path = host_path(device_path);
  fs::create_directories(path.parent_path());
  write_host_file(path, content);
  fs::permissions(path, static_cast<fs::perms>(mode));
}

bool FakeDevice::exists(const std::string& device_path) const {
  struct stat st;
  return lstat(host_path(device_path).c_str(), &st) == 0;
}

void FakeDevice::remove(const std::string& device_path) {
  std::error_code ignored;
  fs::remove(host_path(device_path), ignored);
}

RunResult FakeDevice::run(const std::vector<std::string>& args, const std::string& program,
                          int timeout_seconds) {
  return run_in_root(
      [&]() {
        // Under a wrapper (qemu-user for the aarch64 build, valgrind) the program runs inside it;
        // qemu-user takes argv[0] from QEMU_ARGV0.
        const std::string path = "/system/bin/" + program;
        const char* wrapper = getenv("RB_TEST_WRAPPER");
        const bool wrapped = wrapper != nullptr && wrapper[0] != '\0';
        std::vector<const char*> argv = {program.c_str()};
        if (wrapped) argv = {wrapper, path.c_str()};
        for (const std::string& arg : args) argv.push_back(arg.c_str());
        argv.push_back(nullptr);
        setenv("QEMU_ARGV0", program.c_str(), 1);
        // The tool keeps some memory until it exits on purpose; its leaks are checked under
        // valgrind (scripts/valgrind.sh) against a list of the intended ones.
        setenv("ASAN_OPTIONS", "detect_leaks=0", 1);
        execv(wrapped ? wrapper : path.c_str(), const_cast<char**>(argv.data()));
        perror("execv");
        return 127;
      },
      timeout_seconds);
}

RunResult FakeDevice::run_in_root(const std::function<int()>& fn, int timeout_seconds) {
  const std::string out_path = work_ + "/out", err_path = work_ + "/err";
  fflush(nullptr);
  const auto start = std::chrono::steady_clock::now();
  pid_t pid = fork();
  if (pid == 0) {
    alarm(timeout_seconds);  // survives the exec: the default action of SIGALRM ends the run
    // glibc's freopen keeps the descriptor numbers, which the program inherits.
    if (!freopen(out_path.c_str(), "w", stdout) || !freopen(err_path.c_str(), "w", stderr)) {
      _exit(126);
    }
    if (chroot(root_.c_str()) != 0 || chdir("/") != 0) _exit(125);
    // Without standard input, descriptor 0 is the first one a program opens: it must count as
    // valid.
    close(STDIN_FILENO);
    int rc = fn();
    fflush(nullptr);
    _exit(rc);
  }
  if (pid < 0) return {"", "fork failed"};
  int wstatus = 0;
  struct rusage usage = {};
  size_t fed = 0;  // bytes of standard error handed to the listener
  for (;;) {
    pid_t done = wait4(pid, &wstatus, stderr_listener_ ? WNOHANG : 0, &usage);
    if (stderr_listener_) {
      const std::string err = read_host_file(err_path);
      for (size_t end; (end = err.find('\n', fed)) != std::string::npos; fed = end + 1) {
        stderr_listener_(err.substr(fed, end - fed));
      }
    }
    if (done == pid || (done < 0 && errno != EINTR)) break;
    if (done == 0) usleep(50000);
  }
  RunResult result;
  result.seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
  result.max_rss_kb = usage.ru_maxrss;
  result.status = WIFEXITED(wstatus) ? WEXITSTATUS(wstatus) : 128 + WTERMSIG(wstatus);
  result.timed_out = WIFSIGNALED(wstatus) && WTERMSIG(wstatus) == SIGALRM;
  result.out = read_host_file(out_path);
  result.err = read_host_file(err_path);
  std::error_code ignored;  // removed, so that the next run's listener sees none of these lines
  fs::remove(out_path, ignored);
  fs::remove(err_path, ignored);
  return result;
}

void FakeDevice::write_raw(uint64_t offset, const std::string& bytes) const {
  std::ofstream out(loop_device_, std::ios::binary | std::ios::in | std::ios::out);
  out.seekp(static_cast<std::streamoff>(offset)) << bytes;
}

uint64_t FakeDevice::free_space() const {
  struct statvfs st;
  if (statvfs(host_path("/data").c_str(), &st) != 0) return 0;
  return static_cast<uint64_t>(st.f_bavail) * st.f_bsize;
}

bool FakeDevice::set_free_space(uint64_t bytes) {
  fs::create_directories(host_path("/data/filler"));
  // Extent metadata can cost a block or two more than asked for: close in on the target with a
  // large file that leaves a few blocks, then single blocks, which cost exactly one block each.
  for (int step = 0; step < 64; ++step) {
    const uint64_t now = free_space();
    if (now <= bytes) return now == bytes;
    const uint64_t want = now - bytes > 8 * 4096 ? (now - bytes - 8 * 4096) / 4096 * 4096 : 4096;
    int fd = open(host_path("/data/filler/" + std::to_string(step)).c_str(),
                  O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
    if (fd < 0) return false;
    int rc = fallocate(fd, 0, 0, static_cast<off_t>(want));
    fsync(fd);
    close(fd);
    if (rc != 0) return false;
  }
  return free_space() == bytes;
}
