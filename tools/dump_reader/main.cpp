// ramdump_inspect COMMAND [ARGS]: see kUsage.
#include <stdio.h>
#include <string.h>

#include "tools/dump_reader/cli.h"
#include "tools/dump_reader/commands.h"

namespace {

const char kUsage[] =
    "usage: ramdump_inspect COMMAND [ARGS]\n"
    "Opens what reserveblocks collected after a crash.\n"
    "\n"
    "  misc [--json] MISC            the misc items: enable flag, stored chain header, block\n"
    "                                address, the item the tool leaves alone\n"
    "  verify [--json] [--misc MISC | --first-block N --initial-crc X] OUTPUT\n"
    "                                checks every block's magic, run and chain CRC of a read-out\n"
    "  verify [--json] --device DEVICE --misc MISC\n"
    "                                walks the chain on a raw device or image, read only\n"
    "  list [--json] OUTPUT          the records of the dump stream in a read-out\n"
    "  extract [--force] OUTPUT DIR [NAME...]\n"
    "                                writes every record (or the named ones) as files in DIR\n"
    "  strip OUTPUT FILE             writes the dump stream alone, chain headers removed\n"
    "\n"
    "'ramdump_inspect COMMAND --help' tells more. Exit status: 0 when everything checked\n"
    "holds, 1 on bad or unreadable input, 2 on a usage error.\n";

struct command {
  const char* name;
  int (*run)(int, char**);
};

const command kCommands[] = {
    {"misc", cmd_misc},       {"verify", cmd_verify}, {"list", cmd_list},
    {"extract", cmd_extract}, {"strip", cmd_strip},
};

}  // namespace

int main(int argc, char** argv) {
  if (argc < 2) return usage_error(kUsage, "no command given");
  if (strcmp(argv[1], "--help") == 0 || strcmp(argv[1], "-h") == 0) {
    fputs(kUsage, stdout);
    return kExitOk;
  }
  for (const command& c : kCommands) {
    if (strcmp(argv[1], c.name) == 0) return c.run(argc - 1, argv + 1);
  }
  return usage_error(kUsage, std::string("unknown command '") + argv[1] + "'");
}
