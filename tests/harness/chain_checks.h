// The chain as the firmware will find it, read back through the raw device of a fake device and
// compared with what the test computes itself from the file system's block map (FIBMAP) and
// zlib's crc32.
#pragma once

#include <stdint.h>

#include <string>
#include <vector>

#include "tests/harness/fake_device.h"

// The physical blocks of a file's first count logical blocks; -1 where unmapped.
std::vector<long> map_file(const FakeDevice& device, const std::string& path, uint32_t count);

// "" when every block of the chain over blocks carries the expected header (magic "BCho", next
// block, reserved 0, run length countdown with runs cut at 1024, chain CRC from initial_crc)
// and, when payload_zero, zeros in the rest of the block; otherwise the first difference.
std::string verify_chain(const FakeDevice& device, const std::vector<long>& blocks,
                         uint32_t initial_crc, bool payload_zero);

// The first size bytes of each block on a raw device (host node), in the order given; zeros for
// an unmapped block (-1).
std::string raw_blocks(const std::string& raw, const std::vector<long>& blocks, size_t size = 4096);
// Replaces bytes of the misc image at offset.
void set_misc_item(FakeDevice& device, size_t offset, const std::string& bytes);

// The tool's own log records, without the mount table reader's "[libfs_mgr]" lines.
std::string tool_log(const FakeDevice& device);

// The 24-byte initial block header item as stored in the misc image, and one built from fields.
std::string stored_ibh(const FakeDevice& device);
// A record of the dump stream as the firmware stores it: "F1Le", the name filling its 20-byte
// field as it is (20 characters leave no terminator), the size, a reserved field that readers
// ignore (set nonzero), then content, which may be shorter than size.
std::string dump_record(const std::string& name, uint64_t size, const std::string& content);
// The stream as a read-out holds it: 4080-byte payloads, each behind a chain block header with
// magic "BCho" (the rest zero), the last one padded with the zeros the arming left.
std::string readout_units(const std::string& stream);

std::string make_ibh(uint32_t first_block, uint32_t block_size, uint32_t count, uint32_t crc,
                     uint32_t state);
