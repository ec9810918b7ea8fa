#include "ramdump/usage.h"

#include <stdio.h>

void print_usage(const char* program) {
  fprintf(stderr,
          "usage: %s [-a] [-d] [-e] [-s] [-p] [-r <out file>] [-c <size>] [-t] [-i <crc>] "
          "<block file>\n",
          program);
  fputs(
      "    -r <out file> read from raw block of <block file> to <out file>\n"
      "    -c <size>     also create <block file> of size and convert\n\n"
      "    -t            test block chain integrity\n"
      "    -p            print progress\n"
      "    -i <crc>      specify initial hex crc value\n"
      "    -a            auto read out raw blocks then rearm block chain\n"
      "    -d            disable ramdump\n"
      "    -e            enable ramdump\n"
      "    -s            print ramdump status\n"
      "Convert between raw blocks and files.  If only <block file> parameter\n"
      "is supplied, then just re-write <block file> as raw data.  <block file> must\n"
      "exist, otherwise, use the -c option to create the file before\n"
      "converting it.\n",
      stderr);
}
