#include "ramdump/options.h"

#include <stdlib.h>
#include <unistd.h>

#include "ramdump/usage.h"

// Options written after the block file must not be seen. bionic's getopt never reorders
// arguments; glibc's does unless the option string starts with "+".
#ifdef __BIONIC__
#define RAMDUMP_OPTSTRING "r:c:i:tpades"
#else
#define RAMDUMP_OPTSTRING "+r:c:i:tpades"
#endif

int parse_options(int argc, char** argv, uint32_t default_crc, ramdump_options* out) {
  *out = ramdump_options();
  out->initial_crc = default_crc;
  opterr = 0;  // the usage text is the only complaint about a bad command line
  int c;
  while ((c = getopt(argc, argv, RAMDUMP_OPTSTRING)) != -1) {
    switch (c) {
      case 'r':
        out->read_out_path = optarg;
        break;
      case 'c':
        // Base 10, no suffixes; trailing text is ignored and a negative number wraps.
        out->create = true;
        out->create_size = strtoull(optarg, nullptr, 10);
        if (out->create_size == 0) {
          print_usage(argv[0]);
          return 2;
        }
        break;
      case 'i':
        out->initial_crc = static_cast<uint32_t>(strtoul(optarg, nullptr, 16));
        break;
      case 't':
        out->test = true;
        break;
      case 'p':
        out->progress = true;
        break;
      case 'a':
        out->auto_mode = true;
        break;
      case 'd':
        out->disable = true;
        break;
      case 'e':
        out->enable = true;
        break;
      case 's':
        out->status = true;
        break;
      default:
        print_usage(argv[0]);
        return 2;
    }
  }
  if (optind < argc) out->block_file = argv[optind];
  return 0;
}
