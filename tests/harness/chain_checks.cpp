#include "tests/harness/chain_checks.h"

#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <unistd.h>
#include <zlib.h>

#include <cstring>
#include <iomanip>
#include <sstream>
#include <stdexcept>

namespace {

std::string le32(uint32_t v) {
  std::string s(4, '\0');
  for (int i = 0; i < 4; ++i) s[i] = static_cast<char>(v >> (8 * i));
  return s;
}

std::string hex(const std::string& bytes) {
  std::ostringstream text;
  for (unsigned char c : bytes) text << std::hex << std::setw(2) << std::setfill('0') << +c;
  return text.str();
}

}  // namespace

std::vector<long> map_file(const FakeDevice& device, const std::string& path, uint32_t count) {
  std::vector<long> blocks;
  int fd = open(device.host_path(path).c_str(), O_RDONLY | O_CLOEXEC);
  for (uint32_t i = 0; i < count; ++i) {
    int block = static_cast<int>(i);
    blocks.push_back(fd >= 0 && ioctl(fd, FIBMAP, &block) == 0 ? block : -1);
  }
  if (fd >= 0) close(fd);
  return blocks;
}

std::string verify_chain(const FakeDevice& device, const std::vector<long>& blocks,
                         uint32_t initial_crc, bool payload_zero) {
  const size_t length = payload_zero ? 4096 : 16;
  int fd = open(device.data_device().c_str(), O_RDONLY | O_CLOEXEC);
  std::string raw(length, '\0'), problem;
  uint32_t crc = initial_crc;
  for (size_t i = 0, run_end = 0; i < blocks.size() && problem.empty(); ++i) {
    // A new run starts where the last one ended: consecutive physical blocks, at most 1024.
    if (i == run_end) {
      for (++run_end; run_end < blocks.size() && run_end - i < 1024 &&
                      blocks[run_end] == blocks[run_end - 1] + 1;
           ++run_end) {
      }
    }
    const uint32_t block = static_cast<uint32_t>(blocks[i]);
    const uint32_t next = i + 1 < blocks.size() ? static_cast<uint32_t>(blocks[i + 1]) : 0;
    const std::string numbers = le32(block) + le32(next);
    crc = static_cast<uint32_t>(
        crc32(crc, reinterpret_cast<const Bytef*>(numbers.data()), numbers.size()));
    // Magic, next block, 16 reserved bits (0), run_remaining, CRC; then zeros if asked.
    const std::string header = "BCho" + le32(next) + le32((run_end - i) << 16) + le32(crc);
    if (pread(fd, &raw[0], length, static_cast<off_t>(block) * 4096) != ssize_t(length) ||
        raw.compare(0, 16, header) != 0 ||
        (payload_zero && raw.find_first_not_of('\0', 16) != std::string::npos)) {
      problem = "chain block " + std::to_string(i) + " (physical " + std::to_string(block) +
                "): header " + hex(raw.substr(0, 16)) + ", expected " + hex(header) +
                (payload_zero ? " and zeros" : "");
    }
  }
  if (fd >= 0) close(fd);
  return problem;
}

std::string raw_blocks(const std::string& raw, const std::vector<long>& blocks, size_t size) {
  std::string bytes(blocks.size() * size, '\0');
  int fd = open(raw.c_str(), O_RDONLY | O_CLOEXEC);
  for (size_t i = 0; i < blocks.size(); ++i) {
    // Thrown, so that two failed reads never compare equal (a test reports it as its failure).
    if (blocks[i] >= 0 && pread(fd, &bytes[i * size], size, blocks[i] * 4096) != ssize_t(size)) {
      const std::string why = strerror(errno);
      close(fd);
      throw std::runtime_error("cannot read " + raw + ": " + why);
    }
  }
  close(fd);
  return bytes;
}

void set_misc_item(FakeDevice& device, size_t offset, const std::string& bytes) {
  write_host_file(device.misc_host_path(),
                  device.misc_bytes().replace(offset, bytes.size(), bytes));
}

std::string tool_log(const FakeDevice& device) {
  std::istringstream in(device.log());
  std::string kept;
  for (std::string line; std::getline(in, line);) {
    if (line.find("[libfs_mgr]") == std::string::npos) kept += line + "\n";
  }
  return kept;
}

std::string stored_ibh(const FakeDevice& device) { return device.misc_bytes().substr(3184, 24); }

std::string make_ibh(uint32_t first_block, uint32_t block_size, uint32_t count, uint32_t crc,
                     uint32_t state) {
  return "BHdr" + le32(first_block) + le32(block_size) + le32(count) + le32(crc) + le32(state);
}

std::string dump_record(const std::string& name, uint64_t size, const std::string& content) {
  std::string field = name.substr(0, 20);
  field.resize(20, '\0');
  return "F1Le" + field + le32(static_cast<uint32_t>(size)) +
         le32(static_cast<uint32_t>(size >> 32)) + le32(0x5555) + le32(0) + content;
}

std::string readout_units(const std::string& stream) {
  const size_t payload = 4080;
  std::string out;
  for (size_t at = 0; at < stream.size(); at += payload) {
    std::string piece = stream.substr(at, payload);
    piece.resize(payload, '\0');
    out += "BCho" + std::string(12, '\0') + piece;
  }
  return out;
}
