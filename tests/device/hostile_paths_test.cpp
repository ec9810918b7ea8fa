// A hostile file system around the fixed paths, for the real binary in the fake device root:
// links, FIFOs and extra hard links where the boot-time run expects its own files, devices that
// do not hold the file, and runs that meet on the reserved file. Every run must end in time and
// leave every byte outside the tool's own files as it was.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/file.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <filesystem>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "tests/harness/chain_checks.h"
#include "tests/harness/fake_device.h"

namespace {

namespace fs = std::filesystem;

const std::string kDir = "/data/vendor/ramdump/";
const std::string kReserved = kDir + "RAMDUMP_RESERVED", kStatus = kDir + "RAMDUMP_STATUS",
                  kOutDir = kDir + "apq/00", kFifo = kDir + "fifo";
const char kOther[] = "/dev/block/other";  // the second file system's raw device
const uint32_t kCount = 64;

std::string device_name(dev_t dev) {
  return std::to_string(major(dev)) + ":" + std::to_string(minor(dev));
}

void shell(const std::string& command) { ASSERT_EQ(system(command.c_str()), 0) << command; }

// /data with a victim file and an empty directory, a second ext4 file system at /mnt with a
// victim file and its device at kOther, and a small reserved file that holds a stored dump.
struct Fixture {
  FakeDevice d{16ull << 30};
  std::string other;                        // host node of the second device
  std::vector<long> reserved, victim, mnt;  // blocks of the reserved file and the victims

  void set_up() {
    // The same geometry as /data, so that the reserved file's blocks are data blocks there too.
    other = d.mount_ext4(16ull << 30, "/mnt", kOther);
    d.write_file("/data/victim", std::string(kCount * 4096, 'V'), 0600);
    victim = map_file(d, "/data/victim", kCount);
    d.write_file("/mnt/before", std::string(kCount * 4096, 'W'));  // other blocks than victim's
    d.write_file("/mnt/victim", std::string(kCount * 4096, 'W'), 0600);
    mnt = map_file(d, "/mnt/victim", kCount);
  }

  // The feature enabled, the reserved file armed with a dump stored by the firmware.
  void prepare() {
    if (d.exists("/data/vendor/real")) {
      fs::remove_all(d.host_path("/data/vendor/ramdump"));
      fs::rename(d.host_path("/data/vendor/real"), d.host_path(kDir));
    }
    system(("chattr -R -i " + d.host_path(kDir) + " 2>/dev/null").c_str());
    for (const std::string& path : {kReserved, kStatus, kFifo, kFifo + ".out", kDir + "apq",
                                    std::string("/data/absent"), std::string("/data/elsewhere")}) {
      fs::remove_all(d.host_path(path));
    }
    fs::create_directories(d.host_path("/data/elsewhere"));
    // A failed row must not hide the next one's damage.
    for (long block : victim) d.write_raw(block * 4096ull, std::string(4096, 'V'));
    set_fstab(USERDATA_DEVICE);
    d.write_file(kReserved, std::string(kCount * 4096, '\xFF'), 0744);
    ASSERT_EQ(d.run({"-i", "5eed", kReserved}).status, 0) << d.log();
    reserved = map_file(d, kReserved, kCount);
    set_misc_item(d, 3184, make_ibh(reserved[0], 4096, kCount, 0x5eed, 1));
    set_misc_item(d, 3216, "EnAb");
    d.write_file("/tmp/RAMDUMP_MSG.txt", "watchdog timeout\n");
    ASSERT_EQ(d.run({MISC_DEVICE, USERDATA_DEVICE, "/tmp/RAMDUMP_MSG.txt"}, "firmware_sim").status,
              0);
    d.write_file(kStatus, "", 0666);
    d.set_property("debug.kvo.kvdump", "");
    d.clear_log();
  }

  // Every byte that no run may change.
  std::string untouchable() const {
    return d.read_file("/data/victim") + d.read_file("/mnt/victim") +
           raw_blocks(d.data_device(), victim) + raw_blocks(d.data_device(), mnt) +
           raw_blocks(other, reserved);
  }

  void set_fstab(const std::string& device) {
    d.write_file("/vendor/etc/fstab.rbtest", device + " /data ext4 noatime wait\n");
  }
  void link(const std::string& target, const std::string& path, bool hard = false) {
    d.remove(path);
    fs::create_directories(fs::path(d.host_path(path)).parent_path());
    hard ? fs::create_hard_link(d.host_path(target), d.host_path(path))
         : fs::create_symlink(target, d.host_path(path));
  }
  // A link at a name inside apq/00 that the run cannot remove: it is there when the output is
  // written, as if planted after the old output was deleted.
  void pinned_link(const std::string& name, bool hard = false) {
    if (name != "RAMDUMP_OUTPUT") d.write_file(kOutDir + "/RAMDUMP_OUTPUT", "old");
    link("/data/victim", kOutDir + "/" + name, hard);
    shell("chattr +i " + d.host_path(kOutDir));
  }
  void node(const std::string& path, mode_t type) {  // a FIFO or a socket
    d.remove(path);
    ASSERT_EQ(mknod(d.host_path(path).c_str(), type | 0666, 0), 0);
  }
  void move_dir() { fs::rename(d.host_path(kDir), d.host_path("/data/vendor/real")); }
};

TEST(HostilePaths, RunsTakeTurnsAndNothingOutsideTheToolsFilesChanges) {
  Fixture f;
  REQUIRE_DEVICE(f.d);
  ASSERT_NO_FATAL_FAILURE(f.set_up());
  // A run that finds another one working on the reserved file (played by the test holding the
  // ramdump directory's lock) touches nothing until that one is done, then acts on the state it
  // finds: a dump stored meanwhile is collected. Two real boot-time runs collide only when both
  // pass the presence test before either has created the file, which cannot be forced from here.
  ASSERT_NO_FATAL_FAILURE(f.prepare());
  const std::string misc = f.d.misc_bytes();
  const std::string waiting = "I reserveblocks: Waiting for another run on /data/vendor/ramdump";
  set_misc_item(f.d, 3184, make_ibh(f.reserved[0], 4096, kCount, 0x5eed, 1));  // no dump yet
  const std::string no_dump = f.d.misc_bytes();
  auto held = [&](const std::vector<std::string>& args, const std::function<void()>& meanwhile) {
    f.d.clear_log();
    int dir = open(f.d.host_path(kDir).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    EXPECT_EQ(flock(dir, LOCK_EX), 0);
    RunResult r;
    std::thread run([&] { r = f.d.run(args, "reserveblocks", 30); });
    for (int i = 0; i < 200 && !contains(f.d.log(), waiting); ++i) usleep(50000);
    EXPECT_TRUE(contains(f.d.log(), waiting)) << f.d.log();
    meanwhile();
    close(dir);
    run.join();
    return r;
  };
  // Nothing of the boot-time run happens before it has the lock: not even the block address
  // item, which it writes first.
  RunResult r = held({"-a"}, [&] {
    EXPECT_TRUE(f.d.misc_bytes() == no_dump);
    write_host_file(f.d.misc_host_path(), misc);
  });
  EXPECT_EQ(r.status, 0) << f.d.log();
  EXPECT_EQ(f.d.read_file(kOutDir + "/RAMDUMP_MSG.txt"), "watchdog timeout\n");
  // Conversions take turns too, through another name of the file or when -c is about to create
  // it, and so do switches, which would otherwise leave the misc items disagreeing under a cycle.
  f.link(kReserved, "/data/elsewhere/link");
  for (const auto& args : {std::vector<std::string>{"-t", "-i", "5eed", "/data/elsewhere/link"},
                           {"-c", "65536", kDir + "../ramdump/RAMDUMP_RESERVED"},
                           {"-d"}}) {
    if (args[0] == "-c") f.d.remove(kReserved);
    EXPECT_EQ(held(args, [] {}).status, 0) << args[0];
  }
  // A file of that name in another directory is not the reserved file: it does not wait.
  int dir = open(f.d.host_path(kDir).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  EXPECT_EQ(flock(dir, LOCK_EX), 0);
  EXPECT_EQ(
      f.d.run({"-c", "65536", "/data/elsewhere/RAMDUMP_RESERVED"}, "reserveblocks", 20).status, 0);
  close(dir);
  // A waiting run keeps the directory it opened. When no output can be made there (its apq is
  // immutable), the message is not sought by name: a FIFO waits at that name meanwhile.
  ASSERT_NO_FATAL_FAILURE(f.prepare());
  const std::string real_apq = f.d.host_path("/data/vendor/real/apq");
  r = held({"-a"}, [&] {
    f.move_dir();
    fs::create_directories(f.d.host_path(kOutDir));
    f.node(kOutDir + "/RAMDUMP_OUTPUT", S_IFIFO);
    shell("mkdir -p " + real_apq + " && chattr +i " + real_apq);
  });
  EXPECT_EQ(r.status, 255);
  EXPECT_TRUE(contains(r.err, "Unable to open " + kOutDir + "/RAMDUMP_OUTPUT for reading\n"));

  const std::string refused = " is not a regular file with a single link, leaving it alone\\n\n",
                    out = "failed to open outfile:" + kOutDir + "/RAMDUMP_OUTPUT for writing: ",
                    not_held = std::string(kOther) + " does not hold " + kReserved + "\\n\n",
                    no_dir = "Not a directory\\n\n", nxio = ": No such device or address\\n\n",
                    no_msg = "Could not open file 'RAMDUMP_MSG.txt' for writing\n",
                    fifo_out = kFifo + " for writing" + nxio;
  const std::function<void()> fifo = [&] { f.node(kFifo, S_IFIFO); },
                              other = [&] { f.set_fstab(kOther); },
                              empty = [&] { f.set_fstab(kOther), f.d.write_file(kFifo, ""); };
  const std::vector<std::string> boot = {"-a"}, test_fifo = {"-t", kFifo},
                                 read_fifo = {"-r", kFifo + ".out", kFifo};
  // log: an error record of the tool's log or a line on its standard error; "": no error record.
  const struct {
    std::function<void()> plant;
    std::vector<std::string> args;
    int status;
    std::string log;
  } rows[] = {
      // Links, a second name and a FIFO at the reserved file and the request file.
      {[&] { f.link("/data/victim", kReserved); }, boot, 255, kReserved + refused},
      {[&] { f.link("/data/victim", kReserved, true); }, boot, 255, kReserved + refused},
      {[&] { f.node(kReserved, S_IFIFO); }, boot, 255, kReserved + refused},
      {[&] { f.link("/data/absent", kStatus); }, boot, 0, kStatus + refused},
      {[&] { f.node(kStatus, S_IFIFO); }, boot, 0, kStatus + refused},
      // A linked ramdump directory is as good as missing: the feature is switched off.
      {[&] { f.move_dir(), f.link("/data/elsewhere", "/data/vendor/ramdump"); }, boot, 255,
       "Could not statvfs /data/vendor/ramdump: " + no_dir},
      {[&] { f.link("/data/elsewhere", kDir + "apq"); }, boot, 255, out + no_dir},
      {[&] { f.link("/data/elsewhere", kOutDir); }, boot, 255, out + no_dir},
      // Links in place when the output and the message are written.
      {[&] { f.pinned_link("RAMDUMP_OUTPUT"); }, boot, 255,
       out + "Too many levels of symbolic links\\n\n"},
      {[&] { f.pinned_link("RAMDUMP_MSG.txt"); }, boot, 0, no_msg},
      {[&] { f.pinned_link("RAMDUMP_MSG.txt", true); }, boot, 0, no_msg},
      // The mount table names the second file system's device: nothing is read, nor written into
      // it, and the dump stays in the reserved blocks. Without a block to read, the device is never
      // touched: its check does not apply.
      {other, boot, 255, not_held},
      {other, {"-i", "1", kReserved}, 255, not_held},
      {other, {"-t", kReserved}, 255, not_held},
      {empty, test_fifo, 0, ""},
      {empty, read_fifo, 0, ""},
      // A person's paths are taken as typed, but no open waits for a FIFO's other end.
      {fifo, test_fifo, 0,
       "Failed to get block 0 for file " + kFifo + ": Inappropriate ioctl for device\\n\n"},
      {fifo, read_fifo, 0, ""},
      {fifo, {"-r", kFifo, kReserved}, 255, "failed to open outfile:" + fifo_out},
      {fifo, {"-c", "65536", kFifo}, 255, "failed to open file:" + fifo_out},
      {[&] { f.node(kFifo, S_IFSOCK); }, test_fifo, 255,
       "failed to open " + kFifo + " for reading" + nxio},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE("row " + std::to_string(&row - rows));
    ASSERT_NO_FATAL_FAILURE(f.prepare());
    const std::string before = f.untouchable(), dump = raw_blocks(f.d.data_device(), f.reserved);
    row.plant();
    r = f.d.run(row.args, "reserveblocks", 20);
    EXPECT_EQ(r.status, row.status) << f.d.log();
    EXPECT_TRUE(row.log.empty() ? !contains(tool_log(f.d), "E reserveblocks: ")
                                : contains(tool_log(f.d), "E reserveblocks: " + row.log) ||
                                      contains(r.err, row.log))
        << f.d.log() << r.err;
    std::error_code none;  // the directory's link is absolute, into the device's root
    for (const auto& entry : fs::directory_iterator(f.d.host_path(kDir), none)) {
      const std::string name = " " + entry.path().filename().string() + " ";
      EXPECT_TRUE(contains(" RAMDUMP_RESERVED RAMDUMP_STATUS apq fifo fifo.out ", name)) << name;
    }
    EXPECT_TRUE(f.untouchable() == before && fs::is_empty(f.d.host_path("/data/elsewhere")) &&
                !f.d.exists("/data/absent"));
    if (row.args == boot) {
      EXPECT_EQ(f.d.property("debug.kvo.kvdump"), row.status == 0 ? "done" : "fail");
      EXPECT_TRUE(row.log != not_held || (raw_blocks(f.d.data_device(), f.reserved) == dump &&
                                          !f.d.exists(kOutDir + "/RAMDUMP_OUTPUT")));
    }
  }
  // As if /data were on a device-mapper device stacked on the second device alone: the chain
  // goes into the second device, at the file's blocks, as it is on /data's.
  ASSERT_NO_FATAL_FAILURE(f.prepare());
  struct stat data, st;
  ASSERT_EQ(stat(f.d.host_path(kReserved).c_str(), &data) | stat(f.other.c_str(), &st), 0);
  fs::create_directories(f.d.host_path("/sys"));
  ASSERT_EQ(mount("rbsys", f.d.host_path("/sys").c_str(), "tmpfs", 0, nullptr), 0);
  const std::string slaves = "/sys/dev/block/" + device_name(data.st_dev) + "/slaves/";
  fs::create_directories(f.d.host_path(slaves + "../dm"));
  f.d.write_file(slaves + "loopx/dev", device_name(st.st_rdev) + "\n");
  f.set_fstab(kOther);
  EXPECT_EQ(f.d.run({"-i", "5eed", kReserved}).status, 0) << f.d.log();
  EXPECT_TRUE(raw_blocks(f.other, f.reserved, 16) == raw_blocks(f.d.data_device(), f.reserved, 16));
  f.d.write_file(slaves + "loopy/dev", device_name(st.st_rdev) + "\n");  // two slaves
  EXPECT_EQ(f.d.run({"-t", kReserved}).status, 255);
}

}  // namespace
