// benchmark: the tool's heavy operations and the dump inspector's commands at full size in a fake
// device root (a 16 GiB ext4 /data on a loop device), each next to a baseline doing the same I/O
// on the same file system and device, written to a results file.
//
//   benchmark [--runs N] [--out FILE]
//
// Wall time on a shared machine swings by several times from run to run, so besides min, median
// and max of interleaved runs every step also records what the machine's load cannot change: the
// bytes the loop device read and wrote (against the least the operation needs) and the CPU time
// of the process. Each step starts with the caches dropped and ends when a sync of /data has put
// its data on the device. --size BYTES (a multiple of 4096) shrinks the reserved file for a
// quick check of the benchmark itself.
#include <fcntl.h>
#include <malloc.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/utsname.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <functional>
#include <sstream>
#include <string>
#include <vector>

#include "tests/harness/chain_checks.h"
#include "tests/harness/fake_device.h"

namespace {

const char kReserved[] = "/data/vendor/ramdump/RAMDUMP_RESERVED";
const char kBootDir[] = "/data/vendor/ramdump/apq";  // where the second boot collects
const char kDump[] = "/data/dump.out";               // the inspector's read-out
const char kDumpMisc[] = "/tmp/dump.misc";           // the misc image that goes with it
const char kScratch[] = "/data/bench.out";           // a step's output, removed after it
const uint64_t kBlock = 4096, kPayload = 4080, kRecordHeader = 40;
const uint64_t kMiB = 1 << 20;

struct Sample {
  double seconds = 0, cpu = 0;             // wall time to the end of the sync; user + system time
  uint64_t dev_read = 0, dev_written = 0;  // by the loop device
  uint64_t fs_read = 0, fs_written = 0;    // block I/O the process caused (rusage)
  long rss_kb = 0;
};

// One operation: the tool's command and a baseline of the same I/O, run in the root.
struct Operation {
  std::string name;
  std::function<RunResult()> tool, baseline;
  int tool_status = 0;
  uint64_t min_read = 0, min_written = 0;  // device bytes the operation cannot do without
  double goal = 1.1;                       // for the ratio of the minimums
  bool inspector = false;
  bool maps_file = false;  // the tool walks the file's blocks with FIBMAP first
  enum { kAlternate, kBaselineFirst, kToolFirst } order = kAlternate;
  std::function<void()> before_tool;  // untimed set-up
  std::vector<Sample> tool_runs, baseline_runs;
};

// Runs of physically consecutive blocks of the file in chain order: (first block, length).
using Extents = std::vector<std::pair<long, long>>;

Extents extents_of(const std::vector<long>& blocks) {
  Extents extents;
  for (long b : blocks) {
    if (!extents.empty() && extents.back().first + extents.back().second == b) {
      ++extents.back().second;
    } else {
      extents.push_back({b, 1});
    }
  }
  return extents;
}

Operation operation(std::string name, std::function<RunResult()> tool,
                    std::function<RunResult()> baseline, uint64_t min_read, uint64_t min_written) {
  Operation op;
  op.name = std::move(name);
  op.tool = std::move(tool);
  op.baseline = std::move(baseline);
  op.min_read = min_read;
  op.min_written = min_written;
  return op;
}

double now_seconds() {
  struct timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return ts.tv_sec + ts.tv_nsec / 1e9;
}

double cpu_of(const struct timeval& user, const struct timeval& sys) {
  return user.tv_sec + sys.tv_sec + (user.tv_usec + sys.tv_usec) / 1e6;
}

// Sectors read (field 3) and written (field 7) by the loop device, in bytes.
void device_counters(const FakeDevice& device, uint64_t* read, uint64_t* written) {
  const std::string name = std::filesystem::path(device.data_device()).filename();
  std::istringstream fields(read_host_file("/sys/block/" + name + "/stat"));
  std::vector<uint64_t> f(7, 0);
  for (uint64_t& v : f) fields >> v;
  *read = f[2] * 512;
  *written = f[6] * 512;
}

void drop_caches() {
  sync();
  write_host_file("/proc/sys/vm/drop_caches", "3");
}

void sync_data(const FakeDevice& device) {
  int fd = open(device.host_path("/data").c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  syncfs(fd);
  close(fd);
}

// Runs one step from cold caches to its data on the device. The child's CPU time and block I/O
// come from the growth of RUSAGE_CHILDREN across its wait.
Sample measure(FakeDevice& device, const std::string& what, const std::function<RunResult()>& run,
               int expected_status, RunResult* result) {
  drop_caches();
  // A child starts its peak RSS from what it shares with this process when it is forked.
  malloc_trim(0);
  Sample s;
  uint64_t read0, written0;
  struct rusage before, after;
  device_counters(device, &read0, &written0);
  getrusage(RUSAGE_CHILDREN, &before);
  const RunResult& r = *result = run();
  const double start = now_seconds();
  sync_data(device);
  s.seconds = r.seconds + (now_seconds() - start);
  getrusage(RUSAGE_CHILDREN, &after);
  device_counters(device, &s.dev_read, &s.dev_written);
  s.dev_read -= read0;
  s.dev_written -= written0;
  s.cpu = cpu_of(after.ru_utime, after.ru_stime) - cpu_of(before.ru_utime, before.ru_stime);
  s.fs_read = static_cast<uint64_t>(after.ru_inblock - before.ru_inblock) * 512;
  s.fs_written = static_cast<uint64_t>(after.ru_oublock - before.ru_oublock) * 512;
  s.rss_kb = r.max_rss_kb;
  if (r.status != expected_status) {
    fprintf(stderr, "benchmark: %s exited %d, expected %d\n%s%s", what.c_str(), r.status,
            expected_status, r.err.c_str(), device.log().c_str());
    exit(1);
  }
  device.clear_log();
  return s;
}

// The file's extents, mapped with one FIBMAP a block as the tool maps it; the walk's wall and CPU
// time from cold caches go to runs.
Extents map_extents(FakeDevice& device, uint64_t count, std::vector<Sample>* runs) {
  drop_caches();
  struct rusage before, after;
  getrusage(RUSAGE_SELF, &before);
  const double start = now_seconds();
  Extents extents = extents_of(map_file(device, kReserved, static_cast<uint32_t>(count)));
  Sample s;
  s.seconds = now_seconds() - start;
  getrusage(RUSAGE_SELF, &after);
  s.cpu = cpu_of(after.ru_utime, after.ru_stime) - cpu_of(before.ru_utime, before.ru_stime);
  runs->push_back(s);
  return extents;
}

// A program from the host's /usr, standard output to stdout_path (inside the root).
RunResult run_host_program(FakeDevice& device, std::vector<std::string> argv,
                           const std::string& stdout_path = "") {
  return device.run_in_root(
      [&] {
        if (!stdout_path.empty()) {
          int fd = open(stdout_path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
          if (fd < 0 || dup2(fd, 1) != 1) return 126;
        }
        std::vector<char*> args;
        for (std::string& a : argv) args.push_back(&a[0]);
        args.push_back(nullptr);
        execv(args[0], args.data());
        return 127;
      },
      3600);
}

// The raw device I/O an operation amounts to, run in the root. Reading copies the chain blocks in
// chain order, at most 4 MiB a request, into copy_to when that is given; writing then
// overwrites them with zeros. one_block: a request for each block, as a walk of the chain makes.
RunResult raw_baseline(FakeDevice& device, const Extents& extents, bool read,
                       const std::string& copy_to, bool overwrite, bool one_block = false) {
  return device.run_in_root(
      [&] {
        const long max_blocks = one_block ? 1 : 1024;
        std::vector<char> buf(max_blocks * kBlock, 0);
        int dev = open(USERDATA_DEVICE, (overwrite ? O_RDWR : O_RDONLY) | O_CLOEXEC);
        int out = copy_to.empty() ? -1 : open(copy_to.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
        for (int pass = read ? 0 : 1; pass <= (overwrite ? 1 : 0); ++pass) {
          for (const auto& extent : extents) {
            for (long done = 0; done < extent.second;) {
              const long n = std::min(extent.second - done, max_blocks);
              const off_t at = static_cast<off_t>(extent.first + done) * kBlock;
              const size_t bytes = static_cast<size_t>(n) * kBlock;
              ssize_t got = pass == 0 ? pread(dev, buf.data(), bytes, at)
                                      : pwrite(dev, buf.data(), bytes, at);
              if (got != static_cast<ssize_t>(bytes)) return 1;
              if (pass == 0 && out >= 0 && write(out, buf.data(), bytes) != got) return 1;
              done += n;
            }
          }
          if (pass == 0 && out >= 0 && fsync(out) != 0) return 1;
          std::fill(buf.begin(), buf.end(), 0);
        }
        return overwrite && fsync(dev) != 0 ? 1 : 0;
      },
      3600);
}

// Writes the chain header the arming printed into misc and lets the simulated firmware store
// files (paths inside the root) as the dump.
void store_dump(FakeDevice& device, const std::string& armed, std::vector<std::string> files) {
  std::istringstream lines(armed);
  std::vector<uint32_t> fields;
  std::string line;
  std::getline(lines, line);  // the block device
  while (std::getline(lines, line)) fields.push_back(strtoul(line.c_str(), nullptr, 16));
  std::string misc = device.misc_bytes();
  misc.replace(3184, 24, make_ibh(fields[2], fields[1], fields[3], fields[4], 1));
  misc.replace(3216, 4, "EnAb");
  write_host_file(device.misc_host_path(), misc);
  files.insert(files.begin(), {MISC_DEVICE, USERDATA_DEVICE});
  RunResult r = device.run(files, "firmware_sim", 3600);
  if (r.status != 0) {
    fprintf(stderr, "benchmark: firmware_sim failed: %s", r.err.c_str());
    exit(1);
  }
}

RunResult run_tool(FakeDevice& device, const std::vector<std::string>& args) {
  return device.run(args, "reserveblocks", 3600);
}

RunResult arm(FakeDevice& device) {
  RunResult r = run_tool(device, {"-i", "1", kReserved});
  if (r.status != 0) {
    fprintf(stderr, "benchmark: arming failed: %s%s", r.err.c_str(), device.log().c_str());
    exit(1);
  }
  device.clear_log();
  return r;
}

// A file of size bytes of varied content (a 1 MiB pattern, so that no layer can skip it).
void write_pattern(FakeDevice& device, const std::string& path, uint64_t size) {
  std::string chunk(kMiB, '\0');
  uint32_t x = 2463534242u;
  for (char& c : chunk) {
    x ^= x << 13, x ^= x >> 17, x ^= x << 5;
    c = static_cast<char>(x);
  }
  FILE* f = fopen(device.host_path(path).c_str(), "wb");
  for (uint64_t left = size; left > 0;) {
    const size_t n = static_cast<size_t>(std::min<uint64_t>(left, chunk.size()));
    fwrite(chunk.data(), 1, n, f);
    left -= n;
  }
  fclose(f);
}

// --- the report ---

std::string fixed(double v, int decimals = 2) {
  char buf[32];
  snprintf(buf, sizeof(buf), "%.*f", decimals, v);
  return buf;
}

std::vector<double> values(const std::vector<Sample>& runs, double Sample::*field) {
  std::vector<double> v;
  for (const Sample& s : runs) v.push_back(s.*field);
  std::sort(v.begin(), v.end());
  return v;
}

double median(const std::vector<double>& sorted) {
  const size_t n = sorted.size();
  return n == 0 ? 0 : n % 2 ? sorted[n / 2] : (sorted[n / 2 - 1] + sorted[n / 2]) / 2;
}

double median_of(const std::vector<Sample>& runs, uint64_t Sample::*field) {
  std::vector<double> v;
  for (const Sample& s : runs) v.push_back(static_cast<double>(s.*field));
  std::sort(v.begin(), v.end());
  return median(v);
}

std::string mib(double bytes) { return fixed(bytes / kMiB, 1); }

// Device bytes a no larger than b, but for the file system's own bookkeeping.
bool no_more(double a, double b) { return a <= b * 1.01 + kMiB; }

// Why an operation's wall time is past its goal, from the figures the load does not change.
std::string why_slower(const Operation& op, const std::vector<Sample>& fibmap_runs) {
  const double tc = median(values(op.tool_runs, &Sample::cpu));
  const double bc = median(values(op.baseline_runs, &Sample::cpu));
  const bool same_bytes = no_more(median_of(op.tool_runs, &Sample::dev_read),
                                  median_of(op.baseline_runs, &Sample::dev_read)) &&
                          no_more(median_of(op.tool_runs, &Sample::dev_written),
                                  median_of(op.baseline_runs, &Sample::dev_written));
  std::string text = same_bytes ? "It moves no more device bytes than its baseline"
                                : "It moves more device bytes than its baseline";
  text += tc <= bc * 1.1 + 0.05
              ? " and uses no more CPU (" + fixed(tc) + " s against " + fixed(bc) +
                    " s): the rest is the load on the machine while it ran."
              : ", but " + fixed(tc - bc) + " s more CPU (" + fixed(tc) + " s against " +
                    fixed(bc) + " s), which a loaded machine stretches into wall time.";
  if (op.maps_file) {
    text += " Its own FIBMAP walk costs " + fixed(median(values(fibmap_runs, &Sample::cpu))) +
            " s CPU and " + fixed(values(fibmap_runs, &Sample::seconds).front()) +
            " s at best; the baseline is handed the blocks.";
  }
  return text;
}

// What the report says besides the operations.
struct Setting {
  uint64_t size = 0;
  int runs = 0;
  double minutes = 0;
  std::string read_ahead_kb;
  std::vector<Sample> fibmap_runs;
  long floor_kb = 0;                 // the peak RSS of true, measured as the steps are
  std::string load_start, load_end;  // 1-minute load averages
};

std::string load_average() {
  std::istringstream in(read_host_file("/proc/loadavg"));
  std::string one;
  in >> one;
  return one;
}

std::string report(const std::vector<Operation>& ops, const Setting& setting) {
  const uint64_t size = setting.size;
  const int runs = setting.runs;
  struct utsname uts;
  uname(&uts);
  time_t t = time(nullptr);
  char date[32];
  strftime(date, sizeof(date), "%Y-%m-%d %H:%M UTC", gmtime(&t));
  std::ostringstream r;
  r << "# Benchmark results\n\n"
    << "Written by `bash scripts/benchmark.sh --runs " << runs << "` on " << date << " ("
    << uts.sysname << " " << uts.release << ", " << sysconf(_SC_NPROCESSORS_ONLN)
    << " CPUs, shared with other work; 1-minute load average " << setting.load_start
    << " at the start, " << setting.load_end << " at the end), in " << fixed(setting.minutes, 0)
    << " minutes. Reserved file " << size << " bytes (" << size / kBlock
    << " blocks of 4096 bytes) on a 16 GiB ext4 file "
    << "system on a loop device. Every step starts with the caches dropped and ends when a sync "
    << "of /data has put its data on the device; tool and baseline run one after the other, "
    << "taking turns going first where their order does not matter.\n\n"
    << "## Wall time (seconds, " << runs << " runs)\n\n"
    << "| Operation | Tool min / median / max | Baseline min / median / max | Ratio of minimums "
       "(goal) | Ratio of medians |\n|---|---|---|---|---|\n";
  std::vector<std::string> missed;
  for (const Operation& op : ops) {
    const std::vector<double> tw = values(op.tool_runs, &Sample::seconds);
    const std::vector<double> bw = values(op.baseline_runs, &Sample::seconds);
    const double ratio_min = tw.front() / bw.front();
    r << "| " << op.name << " | " << fixed(tw.front()) << " / " << fixed(median(tw)) << " / "
      << fixed(tw.back()) << " | " << fixed(bw.front()) << " / " << fixed(median(bw)) << " / "
      << fixed(bw.back()) << " | " << fixed(ratio_min) << " (" << fixed(op.goal, 1)
      << (ratio_min <= op.goal ? ", met" : ", missed") << ") | " << fixed(median(tw) / median(bw))
      << " |\n";
    if (ratio_min > op.goal) {
      missed.push_back(op.name + ": ratio of minimums " + fixed(ratio_min) + ". " +
                       why_slower(op, setting.fibmap_runs));
    }
  }
  r << "\n## What the load does not change (medians of the runs)\n\n"
    << "Device bytes are the loop device's sector counters, file system and journal included. "
       "The process's block I/O is what rusage charges to it (reads it caused, pages it "
       "dirtied). CPU time is user + system time of the process.\n\n"
    << "| Operation | Device read MiB: tool / baseline / minimum | Device written MiB: tool / "
       "baseline / minimum | Process block I/O MiB (read / written) | CPU s: tool / baseline "
       "(ratio) | Peak RSS MiB |\n|---|---|---|---|---|---|\n";
  for (const Operation& op : ops) {
    const double tr = median_of(op.tool_runs, &Sample::dev_read);
    const double tw = median_of(op.tool_runs, &Sample::dev_written);
    const double br = median_of(op.baseline_runs, &Sample::dev_read);
    const double bw = median_of(op.baseline_runs, &Sample::dev_written);
    const double tc = median(values(op.tool_runs, &Sample::cpu));
    const double bc = median(values(op.baseline_runs, &Sample::cpu));
    long rss = 0;
    for (const Sample& s : op.tool_runs) rss = std::max(rss, s.rss_kb);
    r << "| " << op.name << " | " << mib(tr) << " / " << mib(br) << " / " << mib(op.min_read)
      << " | " << mib(tw) << " / " << mib(bw) << " / " << mib(op.min_written) << " | "
      << mib(median_of(op.tool_runs, &Sample::fs_read)) << " / "
      << mib(median_of(op.tool_runs, &Sample::fs_written)) << " | " << fixed(tc) << " / "
      << fixed(bc) << " (" << fixed(bc > 0 ? tc / bc : 0) << ") | " << fixed(rss / 1024.0)
      << " |\n";
    if (!no_more(tr, op.min_read) || !no_more(tw, op.min_written)) {
      missed.push_back(op.name + ": device bytes " + mib(tr) + " MiB read, " + mib(tw) +
                       " MiB written against at least " + mib(op.min_read) + " and " +
                       mib(op.min_written) + " (the baseline: " + mib(br) + " and " + mib(bw) +
                       (no_more(tr, br) && no_more(tw, bw) ? "; readahead, see above)" : ")"));
    }
    if (op.inspector && rss > 16 * 1024) {
      missed.push_back(op.name + ": peak RSS " + fixed(rss / 1024.0) + " MiB");
    }
  }
  r << "\nThe minimums: creation and arming write every block of the file once; the integrity "
       "test needs each chain block's 16-byte header, which the raw device delivers as a whole "
       "4096-byte page; the read-out reads every block and writes it to the output; the second "
       "boot is a read-out and an arming; verify reads the whole read-out; list and extract need "
       "the units up to the one where the stream ends, and extract writes only the records' "
       "contents; strip copies every payload up to the first unit that is not a chain block, "
       "which here is the whole read-out. Reads past a minimum are readahead: the loop device "
       "reads "
    << setting.read_ahead_kb
    << " KiB ahead (twice that in a file read with POSIX_FADV_SEQUENTIAL), past the end of "
       "what a step needs and, on the raw device, across the gaps between the file's extents. "
       "System calls are no longer counted: strace -c slowed every traced run several times and "
       "took most of the benchmark's time, and the figures above do not vary with the load "
       "either.\n\n";
  const std::vector<double> fw = values(setting.fibmap_runs, &Sample::seconds);
  r << "The tool maps the file with one FIBMAP a block before it touches the chain (arming, "
       "integrity test, read-out, second boot); the baselines are given the blocks. That walk "
       "alone, from cold caches: "
    << fixed(fw.front()) << " / " << fixed(median(fw)) << " / " << fixed(fw.back())
    << " s (min / median / max), " << fixed(median(values(setting.fibmap_runs, &Sample::cpu)))
    << " s CPU. A child's peak RSS starts from what it shares with the benchmark when it is "
       "forked: a run of true measures "
    << fixed(setting.floor_kb / 1024.0) << " MiB that way.\n\n## Goals missed\n\n";
  if (missed.empty()) r << "None.\n";
  for (const std::string& m : missed) r << "- " << m << "\n";
  r << "\n## Every run (seconds, in order)\n\n";
  for (const Operation& op : ops) {
    r << "- " << op.name << ": tool";
    for (const Sample& s : op.tool_runs) r << " " << fixed(s.seconds);
    r << "; baseline";
    for (const Sample& s : op.baseline_runs) r << " " << fixed(s.seconds);
    r << "\n";
  }
  return r.str();
}

}  // namespace

int main(int argc, char** argv) {
  int runs = 5;
  uint64_t size = 4429185024ull;
  std::string out_path = "bench/results.md";
  for (int i = 1; i + 1 < argc; i += 2) {
    if (strcmp(argv[i], "--runs") == 0) runs = atoi(argv[i + 1]);
    if (strcmp(argv[i], "--out") == 0) out_path = argv[i + 1];
    if (strcmp(argv[i], "--size") == 0) size = strtoull(argv[i + 1], nullptr, 10);
  }
  if (runs < 1 || size == 0 || size % kBlock != 0) {
    fprintf(stderr, "usage: benchmark [--runs N] [--out FILE] [--size BYTES]\n");
    return 2;
  }
  std::string why;
  if (!fake_device_supported(&why)) {
    fprintf(stderr, "benchmark: %s\n", why.c_str());
    return 1;
  }
  if (!enter_private_mount_namespace("benchmark: private mount namespace")) return 1;
  setvbuf(stdout, nullptr, _IOLBF, 0);
  const double started = now_seconds();
  Setting setting;
  setting.load_start = load_average();
  FakeDeviceConfig config;
  config.data_bytes = 16ull << 30;
  // No inode table initialisation in the background, competing with the timed steps.
  config.mkfs_options = "-E lazy_itable_init=0,lazy_journal_init=0";
  FakeDevice device(config);
  if (!device.setup_error().empty()) {
    fprintf(stderr, "benchmark: %s\n", device.setup_error().c_str());
    return 1;
  }
  mknod(device.host_path("/dev/zero").c_str(), S_IFCHR | 0666, makedev(1, 5));
  std::filesystem::copy_file(std::string(RB_BUILD_DIR) + "/ramdump_inspect",
                             device.host_path("/system/bin/ramdump_inspect"),
                             std::filesystem::copy_options::overwrite_existing);
  const uint64_t count = size / kBlock;
  const std::string size_arg = std::to_string(size);

  // The inspector's read-out: a real one, holding a dump of the size a phone stores.
  printf("making the inspector's read-out\n");
  if (run_tool(device, {"-c", size_arg, "-t", kReserved}).status != 254) {
    fprintf(stderr, "benchmark: creation failed\n%s", device.log().c_str());
    return 1;
  }
  RunResult armed = arm(device);
  const uint64_t memory_size = std::min<uint64_t>(3ull << 30, size / 4 * 3);
  const std::string msg = "benchmark crash: Kernel panic - not syncing: Fatal exception\n";
  write_pattern(device, "/data/memory0.bin", memory_size);
  write_pattern(device, "/data/kernel_log.bin", kMiB);
  device.write_file("/data/RAMDUMP_MSG.txt", msg);
  store_dump(device, armed.out,
             {"/data/memory0.bin", "/data/kernel_log.bin", "/data/RAMDUMP_MSG.txt"});
  for (const char* f : {"/data/memory0.bin", "/data/kernel_log.bin", "/data/RAMDUMP_MSG.txt"}) {
    device.remove(f);
  }
  write_host_file(device.host_path(kDumpMisc), device.misc_bytes());
  if (run_tool(device, {"-r", kDump, kReserved}).status != 0) {
    fprintf(stderr, "benchmark: read-out failed\n%s", device.log().c_str());
    return 1;
  }
  device.clear_log();
  const uint64_t files = memory_size + kMiB + msg.size();
  const uint64_t stream = files + 3 * kRecordHeader;
  // The units holding the stream, and the one whose magic ends it.
  const uint64_t stream_units = (stream + 4 + kPayload - 1) / kPayload * kBlock;

  Extents extents;  // the chain's blocks, for the baselines
  std::vector<Sample> fibmap_runs;
  auto tool = [&device](std::vector<std::string> args) {
    return [&device, args] { return run_tool(device, args); };
  };
  auto inspect = [&device](std::vector<std::string> args) {
    return [&device, args] { return device.run(args, "ramdump_inspect", 3600); };
  };
  auto cat_dump = [&device](std::string to) {
    return [&device, to] { return run_host_program(device, {"/usr/bin/cat", kDump}, to); };
  };
  auto raw = [&](bool read, std::string copy_to, bool overwrite, bool one_block = false) {
    return [&, read, copy_to, overwrite, one_block] {
      return raw_baseline(device, extents, read, copy_to, overwrite, one_block);
    };
  };
  const std::vector<std::string> dd = {
      "/usr/bin/dd", "if=/dev/zero",      "of=" + std::string(kScratch),
      "bs=1M",       "count=" + size_arg, "iflag=count_bytes",
      "conv=fsync",  "status=none"};
  std::vector<Operation> ops = {
      // name, tool, baseline, device bytes it must read and write
      operation(
          "creation", tool({"-c", size_arg, "-t", kReserved}),
          [&device, dd] { return run_host_program(device, dd); }, 0, size),
      operation("arming", tool({"-i", "1", kReserved}), raw(false, "", true), 0, size),
      operation("integrity test", tool({"-t", "-i", "1", kReserved}), raw(true, "", false, true),
                count * kBlock, 0),
      operation("read-out", tool({"-r", kScratch, kReserved}), raw(true, kScratch, false), size,
                size),
      operation("second boot", tool({"-a"}), raw(true, kScratch, true), size, 2 * size),
      operation("inspect verify", inspect({"verify", "--misc", kDumpMisc, kDump}),
                cat_dump("/dev/null"), size, 0),
      operation("inspect list", inspect({"list", kDump}), cat_dump("/dev/null"), stream_units, 0),
      operation("inspect extract", inspect({"extract", kDump, kScratch}), cat_dump(kScratch),
                stream_units, files),
      // strip copies every payload up to the first unit that is not a chain block: it does
      // not look for the stream's end.
      operation("inspect strip", inspect({"strip", kDump, kScratch}), cat_dump(kScratch), size,
                count * kPayload),
  };
  ops[0].tool_status = 254;  // -t after -c stops at once: the chain is not armed yet
  ops[0].before_tool = [&] { device.remove(kReserved); };
  ops[1].order = Operation::kBaselineFirst;  // the baseline overwrites the chain
  ops[4].order = Operation::kToolFirst;      // the baseline overwrites the stored dump
  ops[4].before_tool = [&] {
    device.write_file("/tmp/RAMDUMP_MSG.txt", "benchmark crash\n");
    device.write_file("/tmp/memory0.bin", std::string(kMiB, 'd'));
    store_dump(device, armed.out, {"/tmp/RAMDUMP_MSG.txt", "/tmp/memory0.bin"});
  };
  for (size_t i = 1; i < 5; ++i) ops[i].maps_file = true;
  for (size_t i = 5; i < ops.size(); ++i) ops[i].inspector = true;
  ops[7].goal = ops[8].goal = 1.2;  // writing files costs the file system more than cat's copy

  for (int run = 1; run <= runs; ++run) {
    printf("run %d of %d\n", run, runs);
    for (Operation& op : ops) {
      const bool baseline_first = op.order == Operation::kBaselineFirst ||
                                  (op.order == Operation::kAlternate && run % 2 == 1);
      auto step = [&](bool tool) {
        if (tool && op.before_tool) op.before_tool();
        RunResult r;
        (tool ? op.tool_runs : op.baseline_runs)
            .push_back(tool ? measure(device, op.name, op.tool, op.tool_status, &r)
                            : measure(device, op.name + " baseline", op.baseline, 0, &r));
        std::filesystem::remove_all(device.host_path(kScratch));
        std::filesystem::remove_all(device.host_path(kBootDir));
        if (tool && op.name == "creation") {
          extents = map_extents(device, count, &fibmap_runs);
        }
        if (tool && op.name == "arming") armed = r;
      };
      step(!baseline_first);
      step(baseline_first);
      printf("  %-16s tool %8.2f s, baseline %8.2f s\n", op.name.c_str(),
             op.tool_runs.back().seconds, op.baseline_runs.back().seconds);
    }
  }
  const std::string loop = std::filesystem::path(device.data_device()).filename();
  std::string read_ahead = read_host_file("/sys/block/" + loop + "/queue/read_ahead_kb");
  read_ahead.erase(read_ahead.find_last_not_of("\n") + 1);
  setting.load_end = load_average();
  setting.size = size;
  setting.runs = runs;
  setting.minutes = (now_seconds() - started) / 60;
  setting.read_ahead_kb = read_ahead;
  setting.fibmap_runs = fibmap_runs;
  malloc_trim(0);
  setting.floor_kb = run_host_program(device, {"/usr/bin/true"}).max_rss_kb;
  const std::string text = report(ops, setting);
  printf("\n%s", text.c_str());
  write_host_file(out_path, text);
  printf("\nwritten to %s\n", out_path.c_str());
  return 0;
}
