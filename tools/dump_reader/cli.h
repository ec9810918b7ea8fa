// What every command of ramdump_inspect shares: usage errors, one-line failures naming the
// file, JSON strings and progress on a terminal.
#pragma once

#include <stdint.h>

#include <string>
#include <vector>

struct stat;

constexpr int kExitOk = 0;
constexpr int kExitBad = 1;
constexpr int kExitUsage = 2;

// True when argv holds "--help" or "-h" anywhere; the caller prints its usage to stdout, exit 0.
bool wants_help(int argc, char** argv);

// Splits argv[1..] into options and operands, options accepted anywhere before "--": each one
// must be among flags (a null-terminated list) and sets bit i of *seen for flags[i]; "-" alone is
// an operand. False after a usage error for an unknown option.
bool split_args(int argc, char** argv, const char* const* flags, const char* usage, unsigned* seen,
                std::vector<const char*>* operands);

// Prints "ramdump_inspect: <message>" and then the usage to standard error; returns 2.
int usage_error(const char* usage, const std::string& message);

// Prints "ramdump_inspect: <file>: <problem>" on standard error; returns 1.
int fail(const std::string& file, const std::string& problem);

// Opens path read-only without waiting for a writer (a FIFO without one then reads as empty) and
// without taking it as a controlling terminal, and fills *st. The descriptor, blocking again, or
// -1 with errno.
int open_input(const char* path, struct stat* st);

// Parses a whole decimal (or 0x-prefixed hexadecimal, with hex true: plain hexadecimal) number
// that fits 32 bits.
bool parse_u32(const char* text, bool hex, uint32_t* out);

// The text as a JSON string literal, quotes included; bytes outside printable ASCII are escaped.
std::string json_string(const std::string& text);

// A printable form of a record name for one-line reports: bytes outside printable ASCII as \xNN.
std::string printable(const std::string& bytes);

// Progress on standard error while a long read goes on, only when standard error is a terminal:
// nothing for the first two seconds, then a few updates a second; progress_end clears the line.
struct progress {
  const char* what;
  uint64_t total;
  bool enabled;
  bool shown;
  double start, last;
};
progress progress_begin(const char* what, uint64_t total);
void progress_update(progress* p, uint64_t done);
void progress_end(progress* p);
