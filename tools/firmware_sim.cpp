// firmware_sim: plays the boot firmware after a crash, for tests and demonstrations. See kUsage.
#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <string>
#include <vector>

#include "misc/misc_store.h"
#include "ramdump/chain_format.h"
#include "tools/chain_walk.h"

namespace {

const char kUsage[] =
    "usage: firmware_sim [--verify-only] [--first-record-at N] MISC DEVICE [FILE...]\n"
    "Plays the boot firmware after a crash. Reads the initial block header from the misc\n"
    "partition MISC (image or device), walks the chain through the raw block device DEVICE\n"
    "checking every magic and CRC, writes a dump stream made of the FILEs (each a 40-byte\n"
    "record named after the file's base name, then its content, no padding) into the payloads\n"
    "of the chain blocks in chain order without touching their 16-byte headers, and sets the\n"
    "dump-present bit in the stored header. A broken chain is refused before anything is\n"
    "written.\n"
    "  --verify-only         walk and check the chain, change nothing (opens both read-only)\n"
    "  --first-record-at N   start the stream with a record \"filler.bin\" of N - 40 zero bytes,\n"
    "                        so that the first FILE's header starts at stream offset N\n"
    "                        (0 or at least 40)\n"
    "Exit status: 0, 1 on a refused chain or a failed read or write, 2 on a usage error.\n";

constexpr uint32_t kDumpBlockSize = 4096;  // the dump stream is read back in 4096-byte units
constexpr uint64_t kPayload = kDumpBlockSize - CHAIN_BLOCK_HEADER_SIZE;
const char kFillerName[] = "filler.bin";

int usage_error(const std::string& message) {
  fprintf(stderr, "firmware_sim: %s\n%s", message.c_str(), kUsage);
  return 2;
}

int failure(const std::string& file, const std::string& problem) {
  fprintf(stderr, "firmware_sim: %s: %s\n", file.c_str(), problem.c_str());
  return 1;
}

// One record of the stream: its header, then size bytes read from fd (or zeros when fd < 0).
struct record {
  std::string path;
  int fd;
  uint64_t size;
  uint8_t header[DUMP_FILE_RECORD_SIZE];
};

bool make_record(const std::string& path, int fd, const char* name, uint64_t size, record* out) {
  if (strlen(name) >= DUMP_FILE_NAME_SIZE) {
    fprintf(stderr, "firmware_sim: %s: record name %s is longer than %zu characters\n",
            path.c_str(), name, DUMP_FILE_NAME_SIZE - 1);
    return false;
  }
  dump_file_record r = {};
  r.magic = DUMP_FILE_MAGIC;
  memcpy(r.name, name, strlen(name));
  r.size = size;
  *out = {path, fd, size, {}};
  encode_dump_file_record(r, out->header);
  return true;
}

// The records in stream order, read piece by piece: constant memory whatever the files' sizes.
struct stream_reader {
  std::vector<record>* records;
  size_t current;
  uint64_t offset;  // within the current record, header included
};

// Fills length bytes of the stream into out; false after printing why it cannot.
bool read_stream(stream_reader* s, uint8_t* out, size_t length) {
  while (length > 0) {
    const record& r = (*s->records)[s->current];
    size_t n;
    if (s->offset < DUMP_FILE_RECORD_SIZE) {
      n = std::min<size_t>(DUMP_FILE_RECORD_SIZE - s->offset, length);
      memcpy(out, r.header + s->offset, n);
    } else {
      n = static_cast<size_t>(
          std::min<uint64_t>(DUMP_FILE_RECORD_SIZE + r.size - s->offset, length));
      if (r.fd < 0) {
        memset(out, 0, n);
      } else {
        ssize_t got = read(r.fd, out, n);
        if (got < 0 && errno == EINTR) continue;
        if (got <= 0) {
          failure(r.path, got == 0 ? "unexpected end of file" : strerror(errno));
          return false;
        }
        n = static_cast<size_t>(got);
      }
    }
    out += n;
    length -= n;
    s->offset += n;
    if (s->offset == DUMP_FILE_RECORD_SIZE + r.size) {
      ++s->current;
      s->offset = 0;
    }
  }
  return true;
}

struct writer {
  int dev_fd;
  const char* dev_path;
  stream_reader stream;
  uint64_t left;  // stream bytes still to write
  bool failed;
};

// Stores the next payload's worth of the stream behind the block's header.
bool write_payload(void* context, uint32_t, uint32_t block, const chain_block_header&) {
  writer* w = static_cast<writer*>(context);
  if (w->left == 0) return false;
  uint8_t payload[kPayload];
  const size_t length = static_cast<size_t>(std::min(kPayload, w->left));
  if (!read_stream(&w->stream, payload, length)) {
    w->failed = true;
    return false;
  }
  const uint64_t offset = static_cast<uint64_t>(block) * kDumpBlockSize + CHAIN_BLOCK_HEADER_SIZE;
  ssize_t n = pwrite(w->dev_fd, payload, length, static_cast<off_t>(offset));
  if (n != static_cast<ssize_t>(length)) {
    failure(w->dev_path, "cannot write block " + std::to_string(block) + ": " +
                             (n < 0 ? strerror(errno) : "short write"));
    w->failed = true;
    return false;
  }
  w->left -= length;
  return true;
}

}  // namespace

int main(int argc, char** argv) {
  bool verify_only = false;
  bool filler = false;
  uint64_t first_record_at = 0;
  int i = 1;
  for (; i < argc && strncmp(argv[i], "--", 2) == 0; ++i) {
    const std::string arg = argv[i];
    if (arg == "--help") {
      fputs(kUsage, stdout);
      return 0;
    } else if (arg == "--verify-only") {
      verify_only = true;
    } else if (arg == "--first-record-at") {
      char* end = nullptr;
      if (i + 1 >= argc || argv[i + 1][0] < '0' || argv[i + 1][0] > '9') {
        return usage_error("--first-record-at needs a number");
      }
      errno = 0;
      first_record_at = strtoull(argv[++i], &end, 10);
      if (errno != 0 || *end != '\0' || (first_record_at != 0 && first_record_at < 40)) {
        return usage_error("--first-record-at takes 0 or a number of at least 40");
      }
      filler = first_record_at != 0;
    } else if (arg == "--") {
      ++i;
      break;
    } else {
      return usage_error("unknown option " + arg);
    }
  }
  if (argc - i < 2) return usage_error("MISC and DEVICE are needed");
  const char* misc_path = argv[i];
  const char* dev_path = argv[i + 1];
  const int first_file = i + 2;
  const int open_mode = (verify_only ? O_RDONLY : O_RDWR) | O_CLOEXEC;

  int misc_fd = open(misc_path, open_mode);
  if (misc_fd < 0) return failure(misc_path, std::string("cannot open: ") + strerror(errno));
  initial_block_header ibh;
  if (read_stored_header(misc_fd, &ibh) != 0) {
    return failure(misc_path, "cannot read the initial block header: " + io_problem(errno));
  }
  if (ibh.magic != INITIAL_BLOCK_HEADER_MAGIC) {
    char problem[80];
    snprintf(problem, sizeof(problem), "no armed chain: initial block header magic is %08x",
             ibh.magic);
    return failure(misc_path, problem);
  }
  if (ibh.block_size != kDumpBlockSize) {
    return failure(misc_path, "block size " + std::to_string(ibh.block_size) + ", but dumps are " +
                                  "stored in " + std::to_string(kDumpBlockSize) + "-byte blocks");
  }
  int dev_fd = open(dev_path, open_mode);
  if (dev_fd < 0) return failure(dev_path, std::string("cannot open: ") + strerror(errno));
  chain_walk_result walk;
  int status = walk_chain(dev_fd, ibh, nullptr, nullptr, &walk);
  if (status != WALK_OK) return failure(dev_path, walk_problem(status, walk, ibh));
  if (verify_only) {
    printf("chain: %u blocks from block %u verified (initial CRC %08x)\n", walk.blocks,
           ibh.first_block, ibh.initial_crc);
    return 0;
  }

  // Every file is opened and measured before anything is written.
  const uint64_t capacity = static_cast<uint64_t>(walk.blocks) * kPayload;
  if (filler && first_record_at > capacity) {
    return failure(dev_path, "--first-record-at " + std::to_string(first_record_at) +
                                 " is past the chain's " + std::to_string(capacity) + " bytes");
  }
  std::vector<record> records;
  uint64_t stream_size = 0;
  if (filler) {
    records.emplace_back();
    make_record("--first-record-at", -1, kFillerName, first_record_at - DUMP_FILE_RECORD_SIZE,
                &records.back());
  }
  for (int f = first_file; f < argc; ++f) {
    int fd = open(argv[f], O_RDONLY | O_CLOEXEC);
    struct stat st;
    if (fd < 0 || fstat(fd, &st) != 0) {
      return failure(argv[f], std::string("cannot open: ") + strerror(errno));
    }
    const char* slash = strrchr(argv[f], '/');
    records.emplace_back();
    if (!make_record(argv[f], fd, slash != nullptr ? slash + 1 : argv[f],
                     static_cast<uint64_t>(st.st_size), &records.back())) {
      return 1;
    }
  }
  // Each size is checked against the room left, so the sum cannot overflow.
  bool fits = true;
  for (const record& r : records) {
    if (r.size > capacity || DUMP_FILE_RECORD_SIZE + r.size > capacity - stream_size) {
      fits = false;
      break;
    }
    stream_size += DUMP_FILE_RECORD_SIZE + r.size;
  }
  if (!fits) {
    fprintf(stderr, "firmware_sim: %s: the dump does not fit the chain's %llu bytes\n", dev_path,
            static_cast<unsigned long long>(capacity));
    return 1;
  }

  // The chain was just verified, so the second walk visits the same blocks.
  writer w = {dev_fd, dev_path, {&records, 0, 0}, stream_size, false};
  status = walk_chain(dev_fd, ibh, write_payload, &w, &walk);
  if (w.failed) return 1;
  if (status != WALK_OK) return failure(dev_path, walk_problem(status, walk, ibh));
  if (fsync(dev_fd) != 0) return failure(dev_path, std::string("fsync: ") + strerror(errno));
  close(dev_fd);
  for (const record& r : records) {
    if (r.fd >= 0) close(r.fd);
  }

  const uint32_t old_state = ibh.state;
  ibh.state |= STATE_DUMP_PRESENT;
  uint8_t raw_ibh[INITIAL_BLOCK_HEADER_SIZE];
  encode_initial_block_header(ibh, raw_ibh);
  const misc_item_info& item = gPartitionInfo_MISC[1];
  ssize_t n = pwrite(misc_fd, raw_ibh, item.length, item.offset);
  if (n != static_cast<ssize_t>(item.length) || fsync(misc_fd) != 0) {
    return failure(
        misc_path,
        std::string("cannot store the initial block header: ") +
            (n >= 0 && n < static_cast<ssize_t>(item.length) ? "short write" : strerror(errno)));
  }
  close(misc_fd);
  printf("chain: %u blocks from block %u verified (initial CRC %08x)\n", ibh.block_count,
         ibh.first_block, ibh.initial_crc);
  printf("dump: %zu records, %llu bytes in %llu blocks\n", records.size(),
         static_cast<unsigned long long>(stream_size),
         static_cast<unsigned long long>((stream_size + kPayload - 1) / kPayload));
  printf("state: 0x%08x -> 0x%08x\n", old_state, ibh.state);
  return 0;
}
