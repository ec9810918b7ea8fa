#include "tests/harness/chain_checks.h"

#include <fcntl.h>
#include <linux/fs.h>
#include <stdio.h>
#include <sys/ioctl.h>
#include <unistd.h>
#include <zlib.h>

#include <sstream>

namespace {

std::string le32(uint32_t v) {
  std::string s(4, '\0');
  for (int i = 0; i < 4; ++i) s[i] = static_cast<char>(v >> (8 * i));
  return s;
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
  const size_t kBlock = 4096;
  int fd = open(device.data_device().c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return "cannot open the raw device";
  std::string raw(kBlock, '\0');
  std::string result;
  uint32_t crc = initial_crc;
  size_t run_end = 0;
  for (size_t i = 0; i < blocks.size(); ++i) {
    // A new run starts where the last one ended: consecutive physical blocks, at most 1024.
    if (i == run_end) {
      run_end = i + 1;
      while (run_end < blocks.size() && run_end - i < 1024 &&
             blocks[run_end] == blocks[run_end - 1] + 1) {
        ++run_end;
      }
    }
    uint32_t block = static_cast<uint32_t>(blocks[i]);
    uint32_t next = i + 1 < blocks.size() ? static_cast<uint32_t>(blocks[i + 1]) : 0;
    std::string numbers = le32(block) + le32(next);
    crc = static_cast<uint32_t>(
        crc32(crc, reinterpret_cast<const Bytef*>(numbers.data()), numbers.size()));
    size_t length = payload_zero ? kBlock : 16;
    ssize_t got = pread(fd, &raw[0], length, static_cast<off_t>(block) * kBlock);
    std::ostringstream where;
    where << "chain block " << i << " (physical " << block << "): ";
    if (got != static_cast<ssize_t>(length)) {
      where << "short read";
    } else if (raw.compare(0, 4, "BCho") != 0) {
      where << "bad magic";
    } else if (le32_at(raw, 4) != next) {
      where << "next " << le32_at(raw, 4) << ", expected " << next;
    } else if (le16_at(raw, 8) != 0) {
      where << "reserved bytes not zero";
    } else if (le16_at(raw, 10) != run_end - i) {
      where << "run_remaining " << le16_at(raw, 10) << ", expected " << run_end - i;
    } else if (le32_at(raw, 12) != crc) {
      where << "crc " << std::hex << le32_at(raw, 12) << ", expected " << crc;
    } else if (payload_zero && raw.find_first_not_of('\0', 16) != std::string::npos) {
      where << "payload not zero";
    } else {
      continue;
    }
    result = where.str();
    break;
  }
  close(fd);
  return result;
}

std::string tool_log(const FakeDevice& device) {
  std::istringstream in(device.log());
  std::string line;
  std::string kept;
  while (std::getline(in, line)) {
    if (line.find("[libfs_mgr]") == std::string::npos) kept += line + "\n";
  }
  return kept;
}

std::string stored_ibh(const FakeDevice& device) { return device.misc_bytes().substr(3184, 24); }

std::string make_ibh(uint32_t first_block, uint32_t block_size, uint32_t count, uint32_t crc,
                     uint32_t state) {
  return "BHdr" + le32(first_block) + le32(block_size) + le32(count) + le32(crc) + le32(state);
}
