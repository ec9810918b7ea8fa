// firmware_sim: plays the boot firmware after a crash, for tests and demonstrations.
//
//   firmware_sim MISC DEVICE [FILE...]
//
// Reads the initial block header from the misc partition MISC (image or device), walks the
// chain through the raw block device DEVICE verifying every magic and CRC, writes a dump
// stream made of the FILEs (each a 40-byte record named after the file's base name, then its
// content, no padding) into the payloads of the chain blocks in chain order without touching
// their 16-byte headers, and sets the dump-present bit in the stored header. A broken chain
// is refused before anything is written.
#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <string.h>
#include <unistd.h>

#include <algorithm>
#include <string>
#include <vector>

#include "misc/misc_store.h"
#include "ramdump/chain_format.h"

namespace {

constexpr uint32_t kDumpBlockSize = 4096;  // the dump stream is read back in 4096-byte units

bool read_exact(int fd, uint64_t offset, void* buf, size_t length) {
  ssize_t n = pread(fd, buf, length, static_cast<off_t>(offset));
  return n == static_cast<ssize_t>(length);
}

bool write_exact(int fd, uint64_t offset, const void* buf, size_t length) {
  ssize_t n = pwrite(fd, buf, length, static_cast<off_t>(offset));
  return n == static_cast<ssize_t>(length);
}

bool read_file(const char* path, std::string* out) {
  FILE* f = fopen(path, "rb");
  if (f == nullptr) return false;
  char buf[65536];
  size_t n;
  out->clear();
  while ((n = fread(buf, 1, sizeof(buf), f)) > 0) out->append(buf, n);
  bool ok = ferror(f) == 0;
  fclose(f);
  return ok;
}

// Follows the chain from the stored header and returns its blocks in chain order, or prints
// why the firmware would refuse it and returns false.
bool walk_chain(int dev_fd, const initial_block_header& ibh, std::vector<uint32_t>* blocks) {
  uint32_t block = ibh.first_block;
  uint32_t running_crc = ibh.initial_crc;
  for (uint32_t i = 0; i < ibh.block_count; ++i) {
    uint8_t raw[CHAIN_BLOCK_HEADER_SIZE];
    if (block == 0) {
      fprintf(stderr, "firmware_sim: chain ends after %u of %u blocks\n", i, ibh.block_count);
      return false;
    }
    if (!read_exact(dev_fd, static_cast<uint64_t>(block) * ibh.block_size, raw, sizeof(raw))) {
      fprintf(stderr, "firmware_sim: cannot read block %u (chain block %u): %s\n", block, i,
              strerror(errno));
      return false;
    }
    chain_block_header h = decode_chain_block_header(raw);
    if (h.magic != CHAIN_BLOCK_MAGIC) {
      fprintf(stderr, "firmware_sim: bad magic %08x at block %u (chain block %u)\n", h.magic, block,
              i);
      return false;
    }
    running_crc = chain_crc(running_crc, block, h.next_block);
    if (h.crc != running_crc) {
      fprintf(stderr, "firmware_sim: bad CRC %08x at block %u (chain block %u), expected %08x\n",
              h.crc, block, i, running_crc);
      return false;
    }
    blocks->push_back(block);
    block = h.next_block;
  }
  if (block != 0) {
    fprintf(stderr, "firmware_sim: chain goes on past its %u blocks (to block %u)\n",
            ibh.block_count, block);
    return false;
  }
  return true;
}

// The dump stream of the files: a record header for each, followed by its content.
bool build_stream(int argc, char** argv, std::string* stream) {
  for (int i = 0; i < argc; ++i) {
    std::string content;
    if (!read_file(argv[i], &content)) {
      fprintf(stderr, "firmware_sim: cannot read %s: %s\n", argv[i], strerror(errno));
      return false;
    }
    const char* slash = strrchr(argv[i], '/');
    const char* name = slash != nullptr ? slash + 1 : argv[i];
    if (strlen(name) >= DUMP_FILE_NAME_SIZE) {
      fprintf(stderr, "firmware_sim: record name %s is longer than %zu characters\n", name,
              DUMP_FILE_NAME_SIZE - 1);
      return false;
    }
    dump_file_record record = {};
    record.magic = DUMP_FILE_MAGIC;
    memcpy(record.name, name, strlen(name));
    record.size = content.size();
    uint8_t raw[DUMP_FILE_RECORD_SIZE];
    encode_dump_file_record(record, raw);
    stream->append(reinterpret_cast<const char*>(raw), sizeof(raw));
    stream->append(content);
  }
  return true;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc < 3) {
    fprintf(stderr, "usage: %s MISC DEVICE [FILE...]\n", argv[0]);
    return 2;
  }
  const char* misc_path = argv[1];
  const char* dev_path = argv[2];
  const uint64_t ibh_offset = gPartitionInfo_MISC[1].offset;

  int misc_fd = open(misc_path, O_RDWR | O_CLOEXEC);
  if (misc_fd < 0) {
    fprintf(stderr, "firmware_sim: cannot open %s: %s\n", misc_path, strerror(errno));
    return 1;
  }
  uint8_t raw_ibh[INITIAL_BLOCK_HEADER_SIZE];
  if (!read_exact(misc_fd, ibh_offset, raw_ibh, sizeof(raw_ibh))) {
    fprintf(stderr, "firmware_sim: cannot read the initial block header from %s\n", misc_path);
    return 1;
  }
  initial_block_header ibh = decode_initial_block_header(raw_ibh);
  if (ibh.magic != INITIAL_BLOCK_HEADER_MAGIC) {
    fprintf(stderr, "firmware_sim: no armed chain: initial block header magic is %08x\n",
            ibh.magic);
    return 1;
  }
  if (ibh.block_size != kDumpBlockSize) {
    fprintf(stderr, "firmware_sim: block size %u, but dumps are stored in %u-byte blocks\n",
            ibh.block_size, kDumpBlockSize);
    return 1;
  }
  int dev_fd = open(dev_path, O_RDWR | O_CLOEXEC);
  if (dev_fd < 0) {
    fprintf(stderr, "firmware_sim: cannot open %s: %s\n", dev_path, strerror(errno));
    return 1;
  }
  std::vector<uint32_t> blocks;
  if (!walk_chain(dev_fd, ibh, &blocks)) return 1;

  std::string stream;
  if (!build_stream(argc - 3, argv + 3, &stream)) return 1;
  const uint64_t payload = kDumpBlockSize - CHAIN_BLOCK_HEADER_SIZE;
  if (stream.size() > blocks.size() * payload) {
    fprintf(stderr, "firmware_sim: a dump of %zu bytes does not fit the chain's %llu bytes\n",
            stream.size(), static_cast<unsigned long long>(blocks.size() * payload));
    return 1;
  }
  for (size_t k = 0; k * payload < stream.size(); ++k) {
    size_t length = std::min<size_t>(payload, stream.size() - k * payload);
    uint64_t offset = static_cast<uint64_t>(blocks[k]) * kDumpBlockSize + CHAIN_BLOCK_HEADER_SIZE;
    if (!write_exact(dev_fd, offset, stream.data() + k * payload, length)) {
      fprintf(stderr, "firmware_sim: cannot write block %u: %s\n", blocks[k], strerror(errno));
      return 1;
    }
  }
  fsync(dev_fd);
  close(dev_fd);

  const uint32_t old_state = ibh.state;
  ibh.state |= STATE_DUMP_PRESENT;
  encode_initial_block_header(ibh, raw_ibh);
  if (!write_exact(misc_fd, ibh_offset, raw_ibh, sizeof(raw_ibh)) || fsync(misc_fd) != 0) {
    fprintf(stderr, "firmware_sim: cannot store the initial block header: %s\n", strerror(errno));
    return 1;
  }
  close(misc_fd);
  printf("chain: %zu blocks from block %u verified (initial CRC %08x)\n", blocks.size(),
         ibh.first_block, ibh.initial_crc);
  printf("dump: %d records, %zu bytes in %zu blocks\n", argc - 3, stream.size(),
         (stream.size() + payload - 1) / payload);
  printf("state: 0x%08x -> 0x%08x\n", old_state, ibh.state);
  return 0;
}
