// ramdump_inspect verify: checks a chain block by block, either in a read-out (the chain's
// blocks in chain order, one sequential pass) or on the raw device, walked from the stored
// initial block header like the firmware does. Both forms share the run checks and the report.
#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <string>
#include <vector>

#include "ramdump/chain_format.h"
#include "tools/chain_walk.h"
#include "tools/dump_reader/cli.h"
#include "tools/dump_reader/commands.h"

namespace {

const char kUsage[] =
    "usage: ramdump_inspect verify [--json] [--misc MISC | --first-block N --initial-crc X] "
    "OUTPUT\n"
    "       ramdump_inspect verify [--json] --device DEVICE --misc MISC\n"
    "Checks every block of a chain: its magic, its run_remaining against next_block (runs of\n"
    "consecutive blocks, counting down to 1, at most 1024 blocks), the chain CRC, that the\n"
    "last block ends the chain and the block count.\n"
    "  OUTPUT            a read-out: the chain's blocks in chain order. Each block's CRC is\n"
    "                    checked from the one before; the first block's only with its block\n"
    "                    number and the initial CRC (hexadecimal), given directly or through\n"
    "                    MISC, which also gives the block size (else 4096) and the count.\n"
    "  --device DEVICE   walks the chain on a raw device or an image of one from the initial\n"
    "                    block header stored in MISC, reading only; stops after the stored\n"
    "                    block count + 1 blocks, so a loop is reported, not followed.\n"
    "  --json            one JSON object instead of text\n"
    "Exit status: 0 when everything checked holds, 1 otherwise, 2 on a usage error.\n";

constexpr uint32_t kDefaultBlockSize = 4096;
constexpr size_t kReadSize = 1 << 20;
constexpr uint64_t kWholeChain = UINT64_MAX;  // a problem of the chain, not of one block

// Run lengths 1, 2-3, 4-7, ..., 512-1023 and 1024.
constexpr int kBuckets = 11;
const char* const kBucketNames[kBuckets] = {"1",       "2-3",      "4-7",    "8-15",
                                            "16-31",   "32-63",    "64-127", "128-255",
                                            "256-511", "512-1023", "1024"};

int bucket_of(uint32_t length) {
  int b = 0;
  while (b + 1 < kBuckets && length >= (2u << b)) ++b;
  return b;
}

struct chain_report {
  uint64_t blocks;
  uint64_t runs;
  uint32_t longest;
  uint64_t histogram[kBuckets];
  uint32_t run_left;  // blocks the current run still holds after the last one seen
  uint32_t run_seen;  // blocks of the current run seen: runs count as read, not as claimed
  bool block0_checked;
  bool bad;
  uint64_t bad_index;
  bool bad_block_known;
  uint32_t bad_block;
  std::string reason;
};

// Keeps the first problem only: what follows a bad block is seldom worth reading.
void note_bad(chain_report* r, uint64_t index, bool block_known, uint32_t block,
              const std::string& reason) {
  if (r->bad) return;
  r->bad = true;
  r->bad_index = index;
  r->bad_block_known = block_known;
  r->bad_block = block;
  r->reason = reason;
}

std::string magic_problem(uint32_t found) {
  char text[64];
  snprintf(text, sizeof(text), "bad magic %08x, expected %08x \"BCho\"", found, CHAIN_BLOCK_MAGIC);
  return text;
}

std::string crc_problem(uint32_t found, uint32_t expected) {
  char text[64];
  snprintf(text, sizeof(text), "bad CRC %08x, expected %08x", found, expected);
  return text;
}

// The current run, as far as it was seen, into the longest and the histogram.
void end_run(chain_report* r) {
  if (r->run_seen == 0) return;
  ++r->histogram[bucket_of(r->run_seen)];
  r->longest = std::max(r->longest, r->run_seen);
  r->run_seen = 0;
}

// The run checks of one block whose magic holds, and the run counts. own is the block's own
// number when known (every block but the first of a read-out given alone).
void note_block(chain_report* r, uint64_t index, bool own_known, uint32_t own,
                const chain_block_header& h) {
  const uint32_t remaining = h.run_remaining;
  const bool in_range = remaining >= 1 && remaining <= MAX_RUN_BLOCKS;
  char text[128];
  if (r->run_left > 0 && remaining != r->run_left) {
    snprintf(text, sizeof(text), "run_remaining %u inside a run, expected %u", remaining,
             r->run_left);
    note_bad(r, index, own_known, own, text);
  } else if (!in_range) {
    snprintf(text, sizeof(text), "run_remaining %u is outside 1 to %u", remaining, MAX_RUN_BLOCKS);
    note_bad(r, index, own_known, own, text);
  }
  if (remaining > 1 && own_known && h.next_block != own + 1) {
    snprintf(text, sizeof(text), "run_remaining %u, but next_block %u is not block %u + 1",
             remaining, h.next_block, own);
    note_bad(r, index, own_known, own, text);
  }
  // A block that does not continue the run it is in starts one of its own.
  if (in_range && r->run_left != remaining) {
    end_run(r);
    ++r->runs;
    r->run_seen = 1;
  } else if (in_range) {
    ++r->run_seen;
  } else {
    end_run(r);
  }
  r->run_left = in_range ? remaining - 1 : 0;
}

// The nonempty buckets, each printed with format from its name and count, comma-separated.
void print_histogram(const chain_report& r, const char* format) {
  const char* separator = "";
  for (int b = 0; b < kBuckets; ++b) {
    if (r.histogram[b] == 0) continue;
    fputs(separator, stdout);
    printf(format, kBucketNames[b], static_cast<unsigned long long>(r.histogram[b]));
    separator = ", ";
  }
}

void print_report(const chain_report& r, bool json, const char* kind, const char* path,
                  uint32_t block_size) {
  std::string where;
  if (r.bad && r.bad_index != kWholeChain) {
    where = "chain block " + std::to_string(r.bad_index);
    if (r.bad_block_known) where += " (block " + std::to_string(r.bad_block) + ")";
  }
  if (json) {
    printf(
        "{\"%s\": %s, \"block_size\": %u, \"blocks\": %llu, \"runs\": %llu, "
        "\"longest_run\": %u, \"run_lengths\": {",
        kind, json_string(path).c_str(), block_size, static_cast<unsigned long long>(r.blocks),
        static_cast<unsigned long long>(r.runs), r.longest);
    print_histogram(r, "\"%s\": %llu");
    printf("}, \"block0_checked\": %s, \"ok\": %s, \"first_bad\": ",
           r.block0_checked ? "true" : "false", r.bad ? "false" : "true");
    if (!r.bad) {
      printf("null}\n");
      return;
    }
    std::string index = r.bad_index == kWholeChain ? "null" : std::to_string(r.bad_index);
    std::string block =
        r.bad_index != kWholeChain && r.bad_block_known ? std::to_string(r.bad_block) : "null";
    printf("{\"chain_block\": %s, \"block\": %s, \"reason\": %s}}\n", index.c_str(), block.c_str(),
           json_string(r.reason).c_str());
    return;
  }
  printf("%s: %s (block size %u)\n", kind, path, block_size);
  printf("blocks: %llu\n", static_cast<unsigned long long>(r.blocks));
  printf("runs: %llu, longest %u\n", static_cast<unsigned long long>(r.runs), r.longest);
  printf("run lengths: ");
  print_histogram(r, "%s: %llu");
  printf("%s\n", r.runs == 0 ? "none" : "");
  if (!r.block0_checked)
    printf("chain block 0: CRC not checked (no first block and initial CRC)\n");
  if (!r.bad) {
    printf("result: good\n");
  } else if (r.bad_index == kWholeChain) {
    printf("result: bad: %s\n", r.reason.c_str());
  } else {
    printf("result: bad: first bad block: %s: %s\n", where.c_str(), r.reason.c_str());
  }
}

// The stored initial block header of MISC, which must name a chain.
int stored_chain(const char* misc, initial_block_header* ibh) {
  struct stat st;
  int fd = open_input(misc, &st);
  if (fd < 0) return fail(misc, strerror(errno));
  int rc = read_stored_header(fd, ibh);
  int error = errno;
  close(fd);
  if (rc != 0) return fail(misc, "cannot read the initial block header: " + io_problem(error));
  if (const char* why = no_chain_reason(*ibh)) {
    return fail(misc, std::string("the stored initial block header is ") + why);
  }
  if (ibh->block_size < CHAIN_BLOCK_HEADER_SIZE) {
    return fail(misc, "the stored block size " + std::to_string(ibh->block_size) +
                          " is smaller than a chain block header");
  }
  return kExitOk;
}

struct file_check {
  chain_report report;
  bool has_start;  // first block and initial CRC known: block 0 is checked too
  uint32_t first_block, initial_crc;
  chain_block_header previous;
  bool previous_own_known;  // the previous block's own number, for problems found after it
  uint32_t previous_own;
};

void check_file_block(file_check* c, uint64_t index, const uint8_t raw[CHAIN_BLOCK_HEADER_SIZE]) {
  chain_report* r = &c->report;
  const chain_block_header h = decode_chain_block_header(raw);
  const bool own_known = index > 0 || c->has_start;
  const uint32_t own = index > 0 ? c->previous.next_block : c->first_block;
  if (index > 0 && own == 0) {
    note_bad(r, index - 1, c->previous_own_known, c->previous_own,
             "next_block 0 ends the chain, but more blocks follow");
  }
  if (h.magic != CHAIN_BLOCK_MAGIC) {
    note_bad(r, index, own_known, own, magic_problem(h.magic));
  } else {
    if (own_known) {
      uint32_t expected =
          chain_crc(index > 0 ? c->previous.crc : c->initial_crc, own, h.next_block);
      if (h.crc != expected) note_bad(r, index, true, own, crc_problem(h.crc, expected));
    }
    note_block(r, index, own_known, own, h);
  }
  ++r->blocks;
  c->previous = h;
  c->previous_own_known = own_known;
  c->previous_own = own;
}

int verify_file(const char* path, bool json, uint32_t block_size, bool has_start,
                uint32_t first_block, uint32_t initial_crc, bool has_count, uint32_t count) {
  struct stat st;
  int fd = open_input(path, &st);
  if (fd < 0) return fail(path, strerror(errno));
  posix_fadvise(fd, 0, 0, POSIX_FADV_SEQUENTIAL);
  file_check c = {};
  c.has_start = has_start;
  c.first_block = first_block;
  c.initial_crc = initial_crc;
  c.report.block0_checked = has_start;

  // A block is checked once it is whole, so a trailing partial block never counts.
  std::vector<uint8_t> buffer(kReadSize);
  uint8_t header[CHAIN_BLOCK_HEADER_SIZE];
  uint32_t in_block = 0;
  uint64_t done = 0;
  progress p = progress_begin("verify", static_cast<uint64_t>(st.st_size));
  // Reading stops at the first bad magic, and past the stored count after one block more, so
  // that an endless input (a character device, a pipe) ends too.
  bool stopped = false;
  while (!stopped) {
    ssize_t n = read(fd, buffer.data(), buffer.size());
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) {
      int error = errno;
      progress_end(&p);
      close(fd);
      return fail(path, strerror(error));
    }
    if (n == 0) break;
    const uint8_t* data = buffer.data();
    size_t left = static_cast<size_t>(n);
    while (left > 0 && !stopped) {
      size_t take;
      if (in_block < CHAIN_BLOCK_HEADER_SIZE) {
        take = std::min<size_t>(CHAIN_BLOCK_HEADER_SIZE - in_block, left);
        memcpy(header + in_block, data, take);
      } else {
        take = std::min<size_t>(block_size - in_block, left);
      }
      data += take;
      left -= take;
      in_block += static_cast<uint32_t>(take);
      if (in_block == block_size) {
        check_file_block(&c, c.report.blocks, header);
        in_block = 0;
        stopped = c.previous.magic != CHAIN_BLOCK_MAGIC || (has_count && c.report.blocks > count);
      }
    }
    done += static_cast<uint64_t>(n);
    progress_update(&p, done);
  }
  progress_end(&p);
  close(fd);

  chain_report* r = &c.report;
  if (r->blocks > 0 && c.previous.next_block != 0) {
    note_bad(r, r->blocks - 1, c.previous_own_known, c.previous_own,
             "the chain does not end: next_block " + std::to_string(c.previous.next_block));
  }
  // A regular file's partial last block is reported even when the reading stopped before it,
  // and always on standard error too, whatever problem came first.
  const uint64_t partial = S_ISREG(st.st_mode) ? static_cast<uint64_t>(st.st_size) % block_size
                           : stopped           ? 0
                                               : in_block;
  if (partial != 0) {
    const std::string text = std::to_string(partial) + " bytes after the last whole block";
    note_bad(r, kWholeChain, false, 0, text);
    fail(path, text + ", ignored");
  }
  if (r->blocks == 0) note_bad(r, kWholeChain, false, 0, "no whole block");
  if (has_count && r->blocks != count) {
    note_bad(r, kWholeChain, false, 0,
             std::to_string(r->blocks) + " blocks, but the stored header counts " +
                 std::to_string(count));
  }
  end_run(r);
  print_report(*r, json, "read-out", path, block_size);
  return r->bad ? kExitBad : kExitOk;
}

struct device_check {
  chain_report report;
  progress meter;
  uint32_t block_size;
  uint32_t last_block;  // of the last chain block seen
};

bool visit_device_block(void* context, uint32_t index, uint32_t block,
                        const chain_block_header& header) {
  device_check* c = static_cast<device_check*>(context);
  note_block(&c->report, index, true, block, header);
  ++c->report.blocks;
  c->last_block = block;
  progress_update(&c->meter, static_cast<uint64_t>(c->report.blocks) * c->block_size);
  return true;
}

int verify_device(const char* device, const char* misc, bool json) {
  initial_block_header ibh;
  if (int rc = stored_chain(misc, &ibh)) return rc;
  struct stat st;
  int fd = open_input(device, &st);
  if (fd < 0) return fail(device, strerror(errno));
  device_check c = {};
  c.report.block0_checked = true;
  c.block_size = ibh.block_size;
  c.meter = progress_begin("verify", static_cast<uint64_t>(ibh.block_count) * ibh.block_size);
  chain_walk_result walk;
  int status = walk_chain(fd, ibh, visit_device_block, &c, &walk);
  progress_end(&c.meter);
  close(fd);
  chain_report* r = &c.report;
  switch (status) {
    case WALK_OK:
      break;
    case WALK_READ_FAILED:
      note_bad(r, walk.blocks, true, walk.block, "cannot read it: " + io_problem(walk.error));
      break;
    case WALK_BAD_MAGIC:
      note_bad(r, walk.blocks, true, walk.block, magic_problem(walk.found));
      break;
    case WALK_BAD_CRC:
      note_bad(r, walk.blocks, true, walk.block, crc_problem(walk.found, walk.expected));
      break;
    case WALK_BEYOND_DEVICE:
      note_bad(r, walk.blocks, true, walk.block, "offset beyond the device");
      break;
    case WALK_ENDS_EARLY:
    case WALK_TOO_LONG:
      // The last block seen is the one whose next_block is wrong.
      if (walk.blocks > 0) {
        note_bad(
            r, walk.blocks - 1, true, c.last_block,
            "next_block " + std::to_string(walk.block) + ": " + walk_problem(status, walk, ibh));
        break;
      }
      note_bad(r, kWholeChain, false, 0, walk_problem(status, walk, ibh));
      break;
    default:
      note_bad(r, kWholeChain, false, 0, walk_problem(status, walk, ibh));
      break;
  }
  end_run(r);
  print_report(*r, json, "device", device, ibh.block_size);
  return r->bad ? kExitBad : kExitOk;
}

}  // namespace

int cmd_verify(int argc, char** argv) {
  if (wants_help(argc, argv)) {
    fputs(kUsage, stdout);
    return kExitOk;
  }
  bool json = false, has_first = false, has_crc = false;
  const char *misc = nullptr, *device = nullptr, *output = nullptr;
  uint32_t first_block = 0, initial_crc = 0;
  for (int i = 1; i < argc; ++i) {
    const std::string arg = argv[i];
    const bool takes_value =
        arg == "--misc" || arg == "--device" || arg == "--first-block" || arg == "--initial-crc";
    if (takes_value && i + 1 >= argc) return usage_error(kUsage, arg + " needs a value");
    if (arg == "--json") {
      json = true;
    } else if (arg == "--misc") {
      misc = argv[++i];
    } else if (arg == "--device") {
      device = argv[++i];
    } else if (arg == "--first-block") {
      has_first = true;
      if (!parse_u32(argv[++i], false, &first_block)) {
        return usage_error(kUsage, std::string("bad block number '") + argv[i] + "'");
      }
    } else if (arg == "--initial-crc") {
      has_crc = true;
      if (!parse_u32(argv[++i], true, &initial_crc)) {
        return usage_error(kUsage, std::string("bad hexadecimal CRC '") + argv[i] + "'");
      }
    } else if (arg.size() > 1 && arg[0] == '-') {
      return usage_error(kUsage, "unknown option '" + arg + "'");
    } else if (output != nullptr) {
      return usage_error(kUsage, "one OUTPUT only");
    } else {
      output = argv[i];
    }
  }
  if (device != nullptr) {
    if (misc == nullptr) return usage_error(kUsage, "--device needs --misc");
    if (output != nullptr || has_first || has_crc) {
      return usage_error(kUsage, "--device takes no OUTPUT, --first-block or --initial-crc");
    }
    return verify_device(device, misc, json);
  }
  if (output == nullptr) return usage_error(kUsage, "no OUTPUT given");
  if (has_first != has_crc) {
    return usage_error(kUsage, "--first-block and --initial-crc go together");
  }
  if (misc != nullptr && has_first) {
    return usage_error(kUsage, "--misc or --first-block and --initial-crc, not both");
  }
  if (misc == nullptr) {
    return verify_file(output, json, kDefaultBlockSize, has_first, first_block, initial_crc, false,
                       0);
  }
  initial_block_header ibh;
  if (int rc = stored_chain(misc, &ibh)) return rc;
  return verify_file(output, json, ibh.block_size, true, ibh.first_block, ibh.initial_crc, true,
                     ibh.block_count);
}
