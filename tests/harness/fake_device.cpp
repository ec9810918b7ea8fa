#include "tests/harness/fake_device.h"

#include <errno.h>
#include <fcntl.h>
#include <linux/fs.h>
#include <linux/loop.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/ioctl.h>
#include <sys/mount.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <sys/sysmacros.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>

namespace {

const char* const kPrograms[] = {"reserveblocks", "fstab_dump", "firmware_sim"};

bool run_host_command(const std::string& command) {
  return system((command + " >/dev/null 2>&1").c_str()) == 0;
}

bool make_dirs_host(const std::string& path, mode_t mode = 0755) {
  for (size_t pos = 1; pos <= path.size(); ++pos) {
    if (pos == path.size() || path[pos] == '/') {
      std::string part = path.substr(0, pos);
      if (mkdir(part.c_str(), mode) != 0 && errno != EEXIST) return false;
    }
  }
  return true;
}

bool copy_host_file(const std::string& from, const std::string& to, mode_t mode) {
  std::string bytes = read_host_file(from);
  if (bytes.empty()) return false;
  int fd = open(to.c_str(), O_WRONLY | O_CREAT | O_TRUNC, mode);
  if (fd < 0) return false;
  bool ok = write(fd, bytes.data(), bytes.size()) == static_cast<ssize_t>(bytes.size());
  fchmod(fd, mode);
  return close(fd) == 0 && ok;
}

std::string dirname_of(const std::string& path) {
  size_t slash = path.rfind('/');
  return slash == std::string::npos || slash == 0 ? "/" : path.substr(0, slash);
}

}  // namespace

// Starts a program of the root (path inside the root, argv[0] as given); returns only on
// failure. When RB_TEST_WRAPPER names a qemu-user emulator (a path inside the root, such as
// /usr/bin/qemu-aarch64-static), the program runs under it: that is how the tests drive
// programs built for another architecture. Its -0 keeps argv[0] as given, which the usage
// text shows. The emulator finds the program's shared libraries where the root shows the
// host's /usr, so their packages have to be installed for that architecture too.
void exec_program(const std::string& path, char** argv) {
  const char* wrapper = getenv("RB_TEST_WRAPPER");
  if (wrapper == nullptr || wrapper[0] == '\0') {
    execv(path.c_str(), argv);
    return;
  }
  std::string argv0_flag = "-0";
  std::vector<char*> wrapped = {const_cast<char*>(wrapper), &argv0_flag[0], argv[0],
                                const_cast<char*>(path.c_str())};
  for (char** arg = argv + 1; *arg != nullptr; ++arg) wrapped.push_back(*arg);
  wrapped.push_back(nullptr);
  execv(wrapper, wrapped.data());
}

namespace {

// Live devices, so that a signal can tear them down before the process dies.
std::vector<FakeDevice*> live_devices;

void teardown_on_signal(int sig) {
  for (FakeDevice* device : live_devices) device->teardown();
  signal(sig, SIG_DFL);
  raise(sig);
}

void install_signal_handlers() {
  static bool installed = false;
  if (installed) return;
  installed = true;
  for (int sig : {SIGINT, SIGTERM, SIGHUP}) signal(sig, teardown_on_signal);
}

// Attaches image to a free loop device that detaches itself once nothing holds it any more.
// Returns an open descriptor of the device (the caller closes it once the file system is
// mounted, or the device detaches at once) and its path, or -1.
int attach_loop(const std::string& image, std::string* device_out) {
  int control = open("/dev/loop-control", O_RDWR | O_CLOEXEC);
  int image_fd = open(image.c_str(), O_RDWR | O_CLOEXEC);
  int result = -1;
  for (int attempt = 0; attempt < 20 && control >= 0 && image_fd >= 0 && result < 0; ++attempt) {
    int n = ioctl(control, LOOP_CTL_GET_FREE);
    if (n < 0) break;
    std::string device = "/dev/loop" + std::to_string(n);
    if (access(device.c_str(), F_OK) != 0) mknod(device.c_str(), S_IFBLK | 0660, makedev(7, n));
    int loop_fd = open(device.c_str(), O_RDWR | O_CLOEXEC);
    if (loop_fd < 0) continue;
    if (ioctl(loop_fd, LOOP_SET_FD, image_fd) != 0) {  // taken by someone else meanwhile
      close(loop_fd);
      continue;
    }
    struct loop_info64 info;
    memset(&info, 0, sizeof(info));
    info.lo_flags = LO_FLAGS_AUTOCLEAR;
    ioctl(loop_fd, LOOP_SET_STATUS64, &info);
    *device_out = device;
    result = loop_fd;
  }
  if (image_fd >= 0) close(image_fd);
  if (control >= 0) close(control);
  return result;
}

}  // namespace

bool fake_device_supported(std::string* why) {
  if (geteuid() != 0) {
    *why = "the fake device root needs root (mount namespaces, loop devices, chroot)";
    return false;
  }
  return true;
}

std::string build_dir() { return RB_BUILD_DIR; }

std::string read_host_file(const std::string& path) {
  int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return "";
  std::string bytes;
  char buf[65536];
  for (;;) {
    ssize_t n = read(fd, buf, sizeof(buf));
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;
    bytes.append(buf, static_cast<size_t>(n));
  }
  close(fd);
  return bytes;
}

void write_host_file(const std::string& path, const std::string& content) {
  int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
  if (fd < 0) return;
  ssize_t ignored = write(fd, content.data(), content.size());
  (void)ignored;
  close(fd);
}

uint32_t le32_at(const std::string& b, size_t o) {
  return static_cast<uint32_t>(static_cast<uint8_t>(b.at(o))) |
         static_cast<uint32_t>(static_cast<uint8_t>(b.at(o + 1))) << 8 |
         static_cast<uint32_t>(static_cast<uint8_t>(b.at(o + 2))) << 16 |
         static_cast<uint32_t>(static_cast<uint8_t>(b.at(o + 3))) << 24;
}

uint16_t le16_at(const std::string& b, size_t o) {
  return static_cast<uint16_t>(static_cast<uint8_t>(b.at(o)) | static_cast<uint8_t>(b.at(o + 1))
                                                                   << 8);
}

uint64_t le64_at(const std::string& b, size_t o) {
  return static_cast<uint64_t>(le32_at(b, o)) | static_cast<uint64_t>(le32_at(b, o + 4)) << 32;
}

FakeDevice::FakeDevice(const FakeDeviceConfig& config) {
  install_signal_handlers();
  live_devices.push_back(this);
  env_ = config.env;
  std::string why;
  if (!fake_device_supported(&why)) {
    error_ = why;
    return;
  }
  if (!setup(config)) teardown();
}

FakeDevice::~FakeDevice() {
  teardown();
  live_devices.erase(std::remove(live_devices.begin(), live_devices.end(), this),
                     live_devices.end());
}

bool FakeDevice::fail(const std::string& what) {
  error_ = what + ": " + strerror(errno);
  return false;
}

bool FakeDevice::setup(const FakeDeviceConfig& config) {
  char tmpl[] = "/tmp/rb-device.XXXXXX";
  if (mkdtemp(tmpl) == nullptr) return fail("mkdtemp");
  work_ = tmpl;
  root_ = work_ + "/root";
  if (mkdir(root_.c_str(), 0755) != 0) return fail("mkdir root");
  if (mount("rbroot", root_.c_str(), "tmpfs", 0, "mode=0755") != 0) return fail("mount tmpfs");
  mounts_.push_back(root_);

  std::string usr = root_ + "/usr";
  mkdir(usr.c_str(), 0755);
  if (mount("/usr", usr.c_str(), nullptr, MS_BIND | MS_REC, nullptr) != 0) return fail("bind /usr");
  mounts_.push_back(usr);
  if (mount(nullptr, usr.c_str(), nullptr, MS_REMOUNT | MS_BIND | MS_RDONLY, nullptr) != 0) {
    return fail("remount /usr read-only");
  }
  for (const char* link : {"bin", "lib", "lib64", "lib32", "libx32"}) {
    std::string target = std::string("/usr/") + link;
    struct stat st;
    if (stat(target.c_str(), &st) == 0) {
      if (symlink((std::string("usr/") + link).c_str(), (root_ + "/" + link).c_str()) != 0) {
        return fail("symlink");
      }
    }
  }

  std::string proc = root_ + "/proc";
  mkdir(proc.c_str(), 0555);
  if (mount("proc", proc.c_str(), "proc", MS_NOSUID | MS_NODEV | MS_NOEXEC, nullptr) != 0) {
    return fail("mount /proc");
  }
  mounts_.push_back(proc);
  std::string cmdline = work_ + "/cmdline";
  write_host_file(cmdline, config.cmdline);
  if (mount(cmdline.c_str(), (proc + "/cmdline").c_str(), nullptr, MS_BIND, nullptr) != 0) {
    return fail("bind /proc/cmdline");
  }
  mounts_.push_back(proc + "/cmdline");

  make_dirs("/dev/__properties__");
  make_dirs("/dev/block/bootdevice/by-name");
  make_dirs("/dev/block/platform/msm_sdcc.1/by-name");
  make_dirs("/vendor/etc");
  make_dirs("/system/bin");
  make_dirs("/data");
  make_dirs("/tmp");
  // Some programs want /dev/null; a character device node is enough.
  mknod((root_ + "/dev/null").c_str(), S_IFCHR | 0666, makedev(1, 3));

  for (bool primary : {true, false}) {
    if (primary ? !config.misc_primary : !config.misc_secondary) continue;
    std::string image(config.misc_bytes, static_cast<char>(config.misc_fill));
    write_host_file(misc_host_path(primary), image);
  }

  for (const char* program : kPrograms) {
    std::string from = build_dir() + "/" + program;
    if (access(from.c_str(), X_OK) == 0 &&
        !copy_host_file(from, host_path(std::string("/system/bin/") + program), 0755)) {
      return fail(std::string("copy ") + program);
    }
  }

  std::string fstab_line = config.data_fstab_line;
  if (fstab_line.empty()) {
    fstab_line =
        "/dev/block/bootdevice/by-name/userdata /data ext4 noatime,nosuid,nodev,barrier=1 "
        "wait,check,encryptable=footer\n";
  }
  write_file("/vendor/etc/fstab." + config.hardware, "# fake device mount table\n" + fstab_line);

  if (config.data_bytes != 0 && !setup_data(config)) return false;
  make_dirs("/data/vendor/ramdump");
  return true;
}

bool FakeDevice::setup_data(const FakeDeviceConfig& config) {
  std::string image = work_ + "/data.img";
  int fd = open(image.c_str(), O_RDWR | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
  if (fd < 0 || ftruncate(fd, static_cast<off_t>(config.data_bytes)) != 0) {
    return fail("create data image");
  }
  close(fd);
  // No reserved blocks, so that free space is what statvfs reports as available.
  if (!run_host_command("mkfs.ext4 -q -F -m 0 -b 4096 " + config.mkfs_options + " " + image)) {
    errno = 0;
    return fail("mkfs.ext4 " + image);
  }
  int hold = attach_loop(image, &loop_device_);
  if (hold < 0) return fail("attach loop device");
  std::string data = root_ + "/data";
  int rc = mount(loop_device_.c_str(), data.c_str(), "ext4", 0, "");
  int mount_errno = errno;
  close(hold);
  unlink(image.c_str());  // the loop device keeps the image; nothing is left if we are killed
  errno = mount_errno;
  if (rc != 0) return fail("mount ext4 on " + loop_device_);
  mounts_.push_back(data);
  struct stat st;
  if (stat(loop_device_.c_str(), &st) != 0) return fail("stat loop device");
  if (mknod(host_path("/dev/block/bootdevice/by-name/userdata").c_str(), S_IFBLK | 0600,
            st.st_rdev) != 0) {
    return fail("mknod userdata");
  }
  return true;
}

void FakeDevice::teardown() {
  if (torn_down_) return;
  torn_down_ = true;
  for (auto it = mounts_.rbegin(); it != mounts_.rend(); ++it) {
    if (umount2(it->c_str(), 0) != 0) umount2(it->c_str(), MNT_DETACH);
  }
  mounts_.clear();
  if (!work_.empty()) {
    unlink((work_ + "/data.img").c_str());
    unlink((work_ + "/cmdline").c_str());
    for (const char* name : {"out", "err"}) unlink((work_ + "/" + name).c_str());
    rmdir(root_.c_str());
    rmdir(work_.c_str());
  }
}

std::string FakeDevice::host_path(const std::string& device_path) const {
  return root_ + device_path;
}

void FakeDevice::make_dirs(const std::string& device_path) {
  make_dirs_host(host_path(device_path));
}

void FakeDevice::write_file(const std::string& device_path, const std::string& content,
                            mode_t mode) {
  make_dirs_host(dirname_of(host_path(device_path)));
  std::string path = host_path(device_path);
  int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, mode);
  if (fd < 0) return;
  ssize_t ignored = write(fd, content.data(), content.size());
  (void)ignored;
  fchmod(fd, mode);
  close(fd);
}

std::string FakeDevice::read_file(const std::string& device_path) const {
  return read_host_file(host_path(device_path));
}

bool FakeDevice::exists(const std::string& device_path) const {
  struct stat st;
  return lstat(host_path(device_path).c_str(), &st) == 0;
}

void FakeDevice::remove(const std::string& device_path) {
  std::string path = host_path(device_path);
  if (unlink(path.c_str()) != 0) rmdir(path.c_str());
}

void FakeDevice::set_property(const std::string& name, const std::string& value) {
  write_file("/dev/__properties__/" + name, value);
}

std::string FakeDevice::property(const std::string& name) const {
  return read_file("/dev/__properties__/" + name);
}

std::string FakeDevice::log() const { return read_file("/dev/__log__"); }

void FakeDevice::clear_log() { remove("/dev/__log__"); }

std::string FakeDevice::misc_host_path(bool primary) const {
  return host_path(primary ? "/dev/block/platform/msm_sdcc.1/by-name/misc"
                           : "/dev/block/bootdevice/by-name/misc");
}

std::string FakeDevice::misc_bytes(bool primary) const {
  return read_host_file(misc_host_path(primary));
}

RunResult FakeDevice::wait_child(pid_t pid, const std::string& out_path,
                                 const std::string& err_path, int timeout_seconds) {
  RunResult result;
  struct timespec start;
  clock_gettime(CLOCK_MONOTONIC, &start);
  int wstatus = 0;
  size_t err_seen = 0;  // bytes of standard error already handed to the listener
  std::string partial_line;
  auto feed_listener = [&]() {
    if (!stderr_listener_) return;
    std::string err = read_host_file(err_path);
    if (err.size() <= err_seen) return;
    partial_line += err.substr(err_seen);
    err_seen = err.size();
    size_t newline;
    while ((newline = partial_line.find('\n')) != std::string::npos) {
      stderr_listener_(partial_line.substr(0, newline));
      partial_line.erase(0, newline + 1);
    }
  };
  for (;;) {
    feed_listener();
    struct rusage usage;
    pid_t done = wait4(pid, &wstatus, WNOHANG, &usage);
    if (done == pid) result.max_rss_kb = usage.ru_maxrss;
    if (done == pid) break;
    if (done < 0 && errno != EINTR) break;
    struct timespec now;
    clock_gettime(CLOCK_MONOTONIC, &now);
    if (now.tv_sec - start.tv_sec >= timeout_seconds) {
      kill(pid, SIGKILL);
      waitpid(pid, &wstatus, 0);
      result.timed_out = true;
      break;
    }
    usleep(stderr_listener_ ? 50000 : 2000);
  }
  feed_listener();
  struct timespec end;
  clock_gettime(CLOCK_MONOTONIC, &end);
  result.seconds = (end.tv_sec - start.tv_sec) + (end.tv_nsec - start.tv_nsec) / 1e9;
  result.status = WIFEXITED(wstatus) ? WEXITSTATUS(wstatus) : 128 + WTERMSIG(wstatus);
  result.out = read_host_file(out_path);
  result.err = read_host_file(err_path);
  unlink(out_path.c_str());
  unlink(err_path.c_str());
  return result;
}

RunResult FakeDevice::run(const std::vector<std::string>& args, const std::string& program,
                          int timeout_seconds) {
  std::string path = "/system/bin/" + program;
  return run_in_root(
      [&]() {
        std::vector<char*> argv;
        std::string argv0 = program;
        argv.push_back(&argv0[0]);
        std::vector<std::string> copies(args);
        for (std::string& arg : copies) argv.push_back(&arg[0]);
        argv.push_back(nullptr);
        // The tool keeps some memory until it exits on purpose (the conversion's mount table,
        // the creation buffer, early failure returns), so a sanitizer build must not count that
        // as a failure here; the binary's leaks are checked under valgrind with a list of the
        // intended ones.
        setenv("ASAN_OPTIONS", "detect_leaks=0", 1);
        for (const std::string& entry : env_) {
          size_t eq = entry.find('=');
          if (eq != std::string::npos) {
            setenv(entry.substr(0, eq).c_str(), entry.substr(eq + 1).c_str(), 1);
          }
        }
        exec_program(path, argv.data());
        perror("execv");
        return 127;
      },
      timeout_seconds);
}

RunResult FakeDevice::run_in_root(const std::function<int()>& fn, int timeout_seconds) {
  std::string out_path = work_ + "/out";
  std::string err_path = work_ + "/err";
  fflush(stdout);
  fflush(stderr);
  pid_t pid = fork();
  if (pid == 0) {
    int out = open(out_path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    int err = open(err_path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    if (out < 0 || err < 0 || dup2(out, 1) < 0 || dup2(err, 2) < 0) _exit(126);
    close(out);
    close(err);
    if (chroot(root_.c_str()) != 0 || chdir("/") != 0) _exit(125);
    int rc = fn();
    fflush(stdout);
    fflush(stderr);
    _exit(rc);
  }
  if (pid < 0) {
    RunResult failed;
    failed.err = "fork failed";
    return failed;
  }
  return wait_child(pid, out_path, err_path, timeout_seconds);
}

std::string FakeDevice::read_raw(uint64_t offset, size_t length) const {
  std::string bytes(length, '\0');
  int fd = open(loop_device_.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return "";
  ssize_t n = pread(fd, &bytes[0], length, static_cast<off_t>(offset));
  close(fd);
  bytes.resize(n > 0 ? static_cast<size_t>(n) : 0);
  return bytes;
}

void FakeDevice::write_raw(uint64_t offset, const std::string& bytes) const {
  int fd = open(loop_device_.c_str(), O_WRONLY | O_CLOEXEC);
  if (fd < 0) return;
  ssize_t ignored = pwrite(fd, bytes.data(), bytes.size(), static_cast<off_t>(offset));
  (void)ignored;
  fsync(fd);
  close(fd);
}

long FakeDevice::map_block(const std::string& device_path, uint32_t logical) const {
  int fd = open(host_path(device_path).c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return -1;
  int block = static_cast<int>(logical);
  int rc = ioctl(fd, FIBMAP, &block);
  close(fd);
  return rc == 0 ? static_cast<long>(static_cast<uint32_t>(block)) : -1;
}

uint64_t FakeDevice::free_space() const {
  struct statvfs st;
  if (statvfs(host_path("/data").c_str(), &st) != 0) return 0;
  return static_cast<uint64_t>(st.f_bavail) * st.f_bsize;
}

bool FakeDevice::set_free_space(uint64_t bytes) {
  make_dirs("/data/filler");
  // Extent metadata can cost a block or two more than asked for, so close in on the target
  // with further small files until statvfs reports exactly the wanted number.
  for (int step = 0; step < 64; ++step) {
    uint64_t now = free_space();
    if (now == bytes) return true;
    if (now < bytes) return false;
    std::string path = host_path("/data/filler/" + std::to_string(step));
    int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
    if (fd < 0) return false;
    // Leave a few blocks for extent metadata on the large step; finish with single blocks,
    // which cost exactly one block each.
    uint64_t want = now - bytes;
    want = want > 8 * 4096 ? (want - 8 * 4096) / 4096 * 4096 : 4096;
    int rc = fallocate(fd, 0, 0, static_cast<off_t>(want));
    fsync(fd);
    close(fd);
    if (rc != 0) return false;
  }
  return free_space() == bytes;
}
