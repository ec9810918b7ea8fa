// The command line's option settings.
#pragma once

#include <stdint.h>

struct ramdump_options {
  bool auto_mode = false;               // -a
  bool disable = false;                 // -d
  bool enable = false;                  // -e
  bool status = false;                  // -s
  bool test = false;                    // -t
  bool progress = false;                // -p
  const char* read_out_path = nullptr;  // -r <out file>
  bool create = false;                  // -c <size>
  uint64_t create_size = 0;
  uint32_t initial_crc = 0;          // -i <crc>, else the start-up's random value
  const char* block_file = nullptr;  // the first operand, absent when there is none
};

// Parses the options; parsing stops at the first operand. Returns 0, or 2 after printing the
// usage text for an unknown option, a missing argument or a -c size of 0.
int parse_options(int argc, char** argv, uint32_t default_crc, ramdump_options* out);
