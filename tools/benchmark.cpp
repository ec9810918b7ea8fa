// benchmark: times the tool's heavy operations at full size in a fake device root with a
// 16 GiB ext4 /data on a loop device, next to baselines of the same amount of I/O on the same
// file system and device, and writes the figures to a results file.
//
//   benchmark [--runs N] [--out FILE]
//
// Operations (the 4224 MiB reserved file, 1,081,344 blocks of 4096 bytes):
//   creation     reserveblocks -c SIZE -t FILE   (creation, then a -t that stops at once)
//   arming       reserveblocks -i 1 FILE
//   read-out     reserveblocks -r OUT FILE
//   integrity    reserveblocks -t -i 1 FILE
//   second boot  reserveblocks -a with a stored dump (read-out, extraction, re-arming)
// Baselines:
//   creation     dd of the same size in 64 KiB blocks, fsync
//   arming       the same physical blocks written through the raw device in 4 MiB blocks, fsync
//   read-out     the same physical blocks read through the raw device in 4 MiB blocks into a
//                file on /data, fsync
//   second boot  read-out baseline + arming baseline
// Caches are dropped before every timed step. Each figure is the median of the runs; the
// system call counts come from one extra run of each operation under strace -c.
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/utsname.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <functional>
#include <map>
#include <sstream>
#include <string>
#include <vector>

#include "tests/harness/chain_checks.h"
#include "tests/harness/fake_device.h"

namespace {

const char kReserved[] = "/data/vendor/ramdump/RAMDUMP_RESERVED";
const char kOutput[] = "/data/vendor/ramdump/apq/00/RAMDUMP_OUTPUT";
const char kBenchOut[] = "/data/bench.out";
const uint64_t kSize = 4429185024ull;
const uint32_t kCount = 1081344;
const size_t kChunk = 4u << 20;

struct Measure {
  std::vector<double> seconds;
  long max_rss_kb = 0;
  std::string syscalls = "-";
};

double now_seconds() {
  struct timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return ts.tv_sec + ts.tv_nsec / 1e9;
}

double median(std::vector<double> v) {
  if (v.empty()) return 0;
  std::sort(v.begin(), v.end());
  return v.size() % 2 ? v[v.size() / 2] : (v[v.size() / 2 - 1] + v[v.size() / 2]) / 2;
}

void drop_caches() {
  sync();
  write_host_file("/proc/sys/vm/drop_caches", "3");
}

// Consecutive physical blocks of the file, as (first block, length) pairs.
std::vector<std::pair<long, long>> extents_of(const FakeDevice& device) {
  std::vector<long> blocks = map_file(device, kReserved, kCount);
  std::vector<std::pair<long, long>> extents;
  for (long b : blocks) {
    if (!extents.empty() && extents.back().first + extents.back().second == b) {
      ++extents.back().second;
    } else {
      extents.push_back({b, 1});
    }
  }
  return extents;
}

// The raw device I/O the arming and the read-out amount to, in 4 MiB requests. Returns
// seconds; *calls counts the system calls made.
double raw_baseline(const FakeDevice& device, bool read_out, long* calls) {
  std::vector<std::pair<long, long>> extents = extents_of(device);
  std::vector<char> buf(kChunk, 0);
  drop_caches();
  double start = now_seconds();
  int dev = open(device.data_device().c_str(), read_out ? O_RDONLY : O_WRONLY);
  int out =
      read_out ? open(device.host_path(kBenchOut).c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644) : -1;
  *calls = read_out ? 2 : 1;
  for (const auto& extent : extents) {
    for (long done = 0; done < extent.second;) {
      long blocks = std::min<long>(extent.second - done, kChunk / 4096);
      off_t offset = static_cast<off_t>(extent.first + done) * 4096;
      size_t bytes = static_cast<size_t>(blocks) * 4096;
      if (read_out) {
        if (pread(dev, buf.data(), bytes, offset) != static_cast<ssize_t>(bytes) ||
            write(out, buf.data(), bytes) != static_cast<ssize_t>(bytes)) {
          perror("benchmark: read-out baseline");
        }
        *calls += 2;
      } else {
        if (pwrite(dev, buf.data(), bytes, offset) != static_cast<ssize_t>(bytes)) {
          perror("benchmark: arming baseline");
        }
        *calls += 1;
      }
      done += blocks;
    }
  }
  fsync(read_out ? out : dev);
  close(dev);
  if (out >= 0) close(out);
  *calls += read_out ? 3 : 2;
  double seconds = now_seconds() - start;
  if (read_out) unlink(device.host_path(kBenchOut).c_str());
  return seconds;
}

RunResult run_tool(FakeDevice& device, const std::vector<std::string>& args, Measure* m,
                   int expected_status) {
  drop_caches();
  RunResult r = device.run(args, "reserveblocks", 3600);
  if (r.status != expected_status) {
    fprintf(stderr, "benchmark: reserveblocks exited %d, expected %d\n%s", r.status,
            expected_status, device.log().c_str());
    exit(1);
  }
  m->seconds.push_back(r.seconds);
  m->max_rss_kb = std::max(m->max_rss_kb, r.max_rss_kb);
  device.clear_log();
  return r;
}

double run_dd(FakeDevice& device) {
  drop_caches();
  RunResult r = device.run_in_root(
      [] {
        execl("/usr/bin/dd", "dd", "if=/dev/zero", "of=/data/bench.dd", "bs=64k", "count=67584",
              "conv=fsync", "status=none", static_cast<char*>(nullptr));
        return 127;
      },
      3600);
  device.remove("/data/bench.dd");
  return r.seconds;
}

// The system calls of one run of argv (inside the root) under strace -c, summed.
std::string count_syscalls(FakeDevice& device, const std::vector<std::string>& argv) {
  RunResult r = device.run_in_root(
      [&] {
        std::vector<std::string> words = {"strace", "-c", "-f", "-o", "/tmp/strace.txt"};
        words.insert(words.end(), argv.begin(), argv.end());
        std::vector<char*> args;
        for (std::string& w : words) args.push_back(&w[0]);
        args.push_back(nullptr);
        execv("/usr/bin/strace", args.data());
        return 127;
      },
      7200);
  (void)r;
  std::istringstream in(device.read_file("/tmp/strace.txt"));
  std::string line, last;
  while (std::getline(in, line)) {
    if (line.find("total") != std::string::npos) last = line;
  }
  std::istringstream fields(last);
  std::vector<std::string> words;
  std::string w;
  while (fields >> w) words.push_back(w);
  // "100.00 seconds usecs/call calls [errors] total"
  return words.size() >= 5 ? words[3] : "-";
}

// Stores the chain's header as armed and lets the simulated firmware store a small dump.
void store_dump(FakeDevice& device, const RunResult& armed) {
  std::istringstream lines(armed.out);
  std::vector<uint32_t> fields;
  std::string line;
  std::getline(lines, line);  // the block device
  while (std::getline(lines, line)) fields.push_back(strtoul(line.c_str(), nullptr, 16));
  std::string misc = device.misc_bytes();
  misc.replace(3184, 24, make_ibh(fields[2], fields[1], fields[3], fields[4], 1));
  misc.replace(3216, 4, "EnAb");
  write_host_file(device.misc_host_path(), misc);
  device.write_file("/tmp/RAMDUMP_MSG.txt", "benchmark crash\n");
  device.write_file("/tmp/memory0.bin", std::string(1 << 20, 'd'));
  RunResult r = device.run(
      {MISC_DEVICE, USERDATA_DEVICE, "/tmp/RAMDUMP_MSG.txt", "/tmp/memory0.bin"}, "firmware_sim");
  if (r.status != 0) {
    fprintf(stderr, "benchmark: firmware_sim failed: %s", r.err.c_str());
    exit(1);
  }
}

std::string format_seconds(double s) {
  char buf[32];
  snprintf(buf, sizeof(buf), "%.2f", s);
  return buf;
}

}  // namespace

int main(int argc, char** argv) {
  int runs = 3;
  std::string out_path = "bench/results.md";
  for (int i = 1; i + 1 < argc; i += 2) {
    if (strcmp(argv[i], "--runs") == 0) runs = atoi(argv[i + 1]);
    if (strcmp(argv[i], "--out") == 0) out_path = argv[i + 1];
  }
  std::string why;
  if (!fake_device_supported(&why)) {
    fprintf(stderr, "benchmark: %s\n", why.c_str());
    return 1;
  }
  if (!enter_private_mount_namespace("benchmark: private mount namespace")) return 1;
  setvbuf(stdout, nullptr, _IOLBF, 0);
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

  std::map<std::string, Measure> tool, base;
  const std::string size = std::to_string(kSize);
  RunResult armed;
  for (int run = 1; run <= runs; ++run) {
    printf("run %d of %d\n", run, runs);
    // The step that runs first after a large deletion tends to be slower on a shared disk, so
    // the tool and its baseline take turns going first where their order does not matter.
    const bool baseline_first = run % 2 == 1;
    device.remove(kReserved);
    auto dd = [&] { base["creation"].seconds.push_back(run_dd(device)); };
    if (baseline_first) dd();
    run_tool(device, {"-c", size, "-t", kReserved}, &tool["creation"], 254);
    if (!baseline_first) dd();
    // The arming baseline overwrites the chain, so it always runs before the arming.
    long calls = 0;
    base["arming"].seconds.push_back(raw_baseline(device, false, &calls));
    base["arming"].syscalls = std::to_string(calls);
    armed = run_tool(device, {"-i", "1", kReserved}, &tool["arming"], 0);
    run_tool(device, {"-t", "-i", "1", kReserved}, &tool["integrity test"], 0);
    auto read_baseline = [&] {
      base["read-out"].seconds.push_back(raw_baseline(device, true, &calls));
      base["read-out"].syscalls = std::to_string(calls);
    };
    if (baseline_first) read_baseline();
    run_tool(device, {"-r", kBenchOut, kReserved}, &tool["read-out"], 0);
    device.remove(kBenchOut);
    if (!baseline_first) read_baseline();
    store_dump(device, armed);
    run_tool(device, {"-a"}, &tool["second boot"], 0);
    device.remove(kOutput);
    for (const auto& op : tool) {
      printf("  %-15s %8.2f s\n", op.first.c_str(), op.second.seconds.back());
    }
  }
  for (int i = 0; i < runs; ++i) {
    base["second boot"].seconds.push_back(base["read-out"].seconds[i] + base["arming"].seconds[i]);
  }

  printf("counting system calls\n");
  const std::string bin = "/system/bin/reserveblocks";
  tool["arming"].syscalls = count_syscalls(device, {bin, "-i", "1", kReserved});
  tool["integrity test"].syscalls = count_syscalls(device, {bin, "-t", "-i", "1", kReserved});
  tool["read-out"].syscalls = count_syscalls(device, {bin, "-r", kBenchOut, kReserved});
  device.remove(kBenchOut);
  store_dump(device, armed);
  tool["second boot"].syscalls = count_syscalls(device, {bin, "-a"});
  device.remove(kOutput);
  device.remove(kReserved);
  tool["creation"].syscalls = count_syscalls(device, {bin, "-c", size, "-t", kReserved});
  base["creation"].syscalls =
      count_syscalls(device, {"/usr/bin/dd", "if=/dev/zero", "of=/data/bench.dd", "bs=64k",
                              "count=67584", "conv=fsync", "status=none"});
  device.remove("/data/bench.dd");

  struct utsname uts;
  uname(&uts);
  time_t t = time(nullptr);
  char date[32];
  strftime(date, sizeof(date), "%Y-%m-%d", gmtime(&t));
  std::ostringstream report;
  report << "# Benchmark results\n\n"
         << "Written by `bash scripts/benchmark.sh` on " << date << " (" << uts.sysname << " "
         << uts.release << ", " << sysconf(_SC_NPROCESSORS_ONLN) << " CPUs). Reserved file "
         << kSize << " bytes (" << kCount << " blocks of 4096 bytes) on a 16 GiB ext4 "
         << "file system on a loop device; caches dropped before every timed step; median of "
         << runs << " runs.\n\n"
         << "| Operation | Tool (s) | Baseline (s) | Ratio | Peak RSS (MiB) | System calls "
            "(tool / baseline) | Ratio in each run |\n|---|---|---|---|---|---|---|\n";
  for (const char* op : {"creation", "arming", "read-out", "integrity test", "second boot"}) {
    double tm = median(tool[op].seconds);
    double bm = median(base[op].seconds);
    char ratio[16];
    snprintf(ratio, sizeof(ratio), "%.2f", bm > 0 ? tm / bm : 0);
    report << "| " << op << " | " << format_seconds(tm) << " | "
           << (bm > 0 ? format_seconds(bm) : "-") << " | " << (bm > 0 ? ratio : "-") << " | "
           << format_seconds(tool[op].max_rss_kb / 1024.0) << " | " << tool[op].syscalls << " / "
           << base[op].syscalls << " |";
    for (size_t i = 0; i < tool[op].seconds.size() && i < base[op].seconds.size(); ++i) {
      snprintf(ratio, sizeof(ratio), " %.2f", tool[op].seconds[i] / base[op].seconds[i]);
      report << ratio;
    }
    report << " |\n";
  }
  report << "\nThe integrity test has no baseline of its own: it reads 16 bytes of every block. "
            "The second boot's baseline is the read-out baseline plus the arming baseline.\n\n"
         << "Every run (seconds):\n\n";
  for (auto* group : {&tool, &base}) {
    for (const auto& op : *group) {
      report << "- " << (group == &tool ? "tool " : "baseline ") << op.first << ":";
      for (double s : op.second.seconds) report << " " << format_seconds(s);
      report << "\n";
    }
  }
  printf("\n%s", report.str().c_str());
  write_host_file(out_path, report.str());
  printf("\nwritten to %s\n", out_path.c_str());
  return 0;
}
