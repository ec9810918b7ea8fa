// ramdump_inspect misc: the four items of the misc partition decoded.
#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>

#include "misc/misc_store.h"
#include "ramdump/chain_format.h"
#include "ramdump/le_bytes.h"
#include "ramdump/ramdump_names.h"
#include "tools/chain_walk.h"
#include "tools/dump_reader/cli.h"
#include "tools/dump_reader/commands.h"

namespace {

const char kUsage[] =
    "usage: ramdump_inspect misc [--json] MISC\n"
    "Decodes the items that reserveblocks shares with the boot firmware in MISC, an image of\n"
    "the misc partition or its block device (opened read-only): the enable flag, the stored\n"
    "initial block header, the block address and the item the tool leaves alone.\n"
    "  --json   one JSON object instead of text\n"
    "Exit status: 0, 1 when MISC is unreadable or too short, 2 on a usage error.\n";

// The items by number (gPartitionInfo_MISC), as the misc accessors address them.
constexpr int kItemBlockAddress = 1;
constexpr int kItemInitialHeader = 2;
constexpr int kItemEnableFlag = 3;
constexpr int kItemUnused = 4;
constexpr int kItems = 4;

std::string hex(const uint8_t* p, size_t n, const char* separator) {
  std::string out;
  for (size_t i = 0; i < n; ++i) {
    char byte[4];
    snprintf(byte, sizeof(byte), "%02x", p[i]);
    if (i > 0) out += separator;
    out += byte;
  }
  return out;
}

std::string word_hex(uint32_t v) {
  char text[16];
  snprintf(text, sizeof(text), "%08x", v);
  return text;
}

// "armed, dump present", "other bits 000000f0", or "none".
std::string state_words(uint32_t state, bool json) {
  std::string out;
  auto add = [&](const std::string& word) {
    if (!out.empty()) out += json ? "," : ", ";
    out += json ? json_string(word) : word;
  };
  if (state & STATE_ARMED) add("armed");
  if (state & STATE_DUMP_PRESENT) add("dump present");
  if (state & ~(STATE_ARMED | STATE_DUMP_PRESENT)) {
    add("other bits " + word_hex(state & ~(STATE_ARMED | STATE_DUMP_PRESENT)));
  }
  if (out.empty() && !json) out = "none";
  return out;
}

std::string magic_text(const uint8_t* p) {
  return printable(std::string(reinterpret_cast<const char*>(p), 4));
}

uint32_t offset_of(int item) { return gPartitionInfo_MISC[item - 1].offset; }

}  // namespace

int cmd_misc(int argc, char** argv) {
  if (wants_help(argc, argv)) {
    fputs(kUsage, stdout);
    return kExitOk;
  }
  bool json = false;
  const char* path = nullptr;
  for (int i = 1; i < argc; ++i) {
    if (strcmp(argv[i], "--json") == 0) {
      json = true;
    } else if (argv[i][0] == '-' && argv[i][1] != '\0') {
      return usage_error(kUsage, std::string("unknown option '") + argv[i] + "'");
    } else if (path != nullptr) {
      return usage_error(kUsage, "one MISC only");
    } else {
      path = argv[i];
    }
  }
  if (path == nullptr) return usage_error(kUsage, "no MISC given");

  struct stat st;
  int fd = open_input(path, &st);
  if (fd < 0) return fail(path, strerror(errno));
  uint8_t items[kItems][INITIAL_BLOCK_HEADER_SIZE] = {};
  uint32_t end = 0;
  for (const misc_item_info& info : gPartitionInfo_MISC) {
    if (info.offset + info.length > end) end = info.offset + info.length;
  }
  for (int item = 1; item <= kItems; ++item) {
    if (read_misc_item(fd, item, items[item - 1]) != 0) {
      int error = errno;
      close(fd);
      if (error == 0) {
        return fail(path, "too short: the misc items end at byte " + std::to_string(end));
      }
      return fail(path, "cannot read item " + std::to_string(item) + ": " + strerror(error));
    }
  }
  close(fd);

  const uint8_t* flag = items[kItemEnableFlag - 1];
  const uint8_t* raw_ibh = items[kItemInitialHeader - 1];
  const uint8_t* lba = items[kItemBlockAddress - 1];
  const uint8_t* unused = items[kItemUnused - 1];
  const char* status = get_le32(flag) == RAMDUMP_DISABLED ? "disabled" : "enabled";
  const initial_block_header ibh = decode_initial_block_header(raw_ibh);
  const char* no_chain = no_chain_reason(ibh);
  const uint32_t address = get_le32(lba);
  const bool lba_disabled = address == RAMDUMP_LBA_DISABLED;

  if (json) {
    printf(
        "{\"enable_flag\": {\"offset\": %u, \"hex\": \"%s\", \"text\": %s, \"status\": \"%s\"},\n",
        offset_of(kItemEnableFlag), hex(flag, 4, "").c_str(), json_string(magic_text(flag)).c_str(),
        status);
    printf(
        " \"initial_block_header\": {\"offset\": %u, \"hex\": \"%s\", \"names_chain\": %s, "
        "\"no_chain_reason\": %s,\n  \"magic\": %s, \"magic_value\": \"%s\", \"first_block\": %u, "
        "\"block_size\": %u, \"block_count\": %u, \"initial_crc\": \"%s\", \"state\": %u, "
        "\"state_bits\": [%s]},\n",
        offset_of(kItemInitialHeader), hex(raw_ibh, INITIAL_BLOCK_HEADER_SIZE, "").c_str(),
        no_chain == nullptr ? "true" : "false",
        no_chain == nullptr ? "null" : json_string(no_chain).c_str(),
        json_string(magic_text(raw_ibh)).c_str(), word_hex(ibh.magic).c_str(), ibh.first_block,
        ibh.block_size, ibh.block_count, word_hex(ibh.initial_crc).c_str(), ibh.state,
        state_words(ibh.state, true).c_str());
    printf(
        " \"block_address\": {\"offset\": %u, \"hex\": \"%s\", \"value\": %u, \"disabled\": %s},\n",
        offset_of(kItemBlockAddress), hex(lba, 4, "").c_str(), address,
        lba_disabled ? "true" : "false");
    printf(" \"unused_item\": {\"offset\": %u, \"hex\": \"%s\"}}\n", offset_of(kItemUnused),
           hex(unused, 4, "").c_str());
    return kExitOk;
  }

  printf("enable flag (offset %u): %s \"%s\": %s\n", offset_of(kItemEnableFlag),
         hex(flag, 4, " ").c_str(), magic_text(flag).c_str(), status);
  printf("initial block header (offset %u): %s\n", offset_of(kItemInitialHeader),
         hex(raw_ibh, INITIAL_BLOCK_HEADER_SIZE, " ").c_str());
  if (no_chain != nullptr) printf("  %s\n", no_chain);
  printf("  magic        %08x \"%s\"%s\n", ibh.magic, magic_text(raw_ibh).c_str(),
         ibh.magic == INITIAL_BLOCK_HEADER_MAGIC ? "" : ", not \"BHdr\"");
  printf("  first block  %u\n", ibh.first_block);
  printf("  block size   %u\n", ibh.block_size);
  printf("  block count  %u\n", ibh.block_count);
  printf("  initial CRC  %08x\n", ibh.initial_crc);
  printf("  state        %08x: %s\n", ibh.state, state_words(ibh.state, false).c_str());
  printf("block address (offset %u): %08x: %s\n", offset_of(kItemBlockAddress), address,
         lba_disabled ? "the disable value" : "a block address, not the disable value");
  printf("unused item (offset %u, left alone by the tool): %s\n", offset_of(kItemUnused),
         hex(unused, 4, " ").c_str());
  return kExitOk;
}
