// ramdump_inspect extract: the records of the dump stream as files in a directory. Contents are
// written straight from the read buffer, one write per read and file, so a record of any size
// takes no memory of its own.
#include <errno.h>
#include <fcntl.h>
#include <inttypes.h>
#include <limits.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "tools/dump_reader/cli.h"
#include "tools/dump_reader/commands.h"
#include "tools/dump_reader/dump_stream.h"
#include "tools/dump_reader/readout_reader.h"

namespace {

const char kUsage[] =
    "usage: ramdump_inspect extract [--force] OUTPUT DIR [NAME...]\n"
    "Writes every record of the dump stream in a read-out (RAMDUMP_OUTPUT), or only those\n"
    "named, as files in DIR, which is created if it is missing, and prints each file written\n"
    "with its size.\n"
    "\n"
    "A name that is not a safe plain file name (empty, \".\", \"..\", holding \"/\", a control\n"
    "character or a non-ASCII byte, or without terminator) is written with '_' for each unsafe\n"
    "byte, or as record_<stream offset> where that leaves nothing usable, and with a '_'\n"
    "appended when it has no terminator. A name that repeats\n"
    "gets a suffix .1, .2, ... Each replacement is printed. A NAME matches a record's name or\n"
    "the file name it is written under.\n"
    "\n"
    "Writes only into DIR and follows no symbolic link there. An existing file is left alone\n"
    "and the record not written, unless --force is given, which replaces regular files only.\n"
    "A record that the data cuts short is written as far as it goes, and reported. The first\n"
    "unit whose chain block magic is not \"BCho\" ends the data; a partial last unit is ignored.\n"
    "\n"
    "Exit status: 0 when every wanted record was written complete, 1 otherwise, 2 on a usage\n"
    "error.\n";

struct extract_state {
  const char* dir;
  int dir_fd;
  bool force;
  std::vector<std::string> wanted;  // empty: all
  std::vector<bool> found;
  name_set names;  // record and file names met, with the flags below
  int fd;          // the current record's file, or -1 while records are skipped
  std::string file, note;
  bool failed;
  dev_t readout_dev;  // the read-out, which --force never replaces
  ino_t readout_ino;
  progress* prog;  // cleared before a line is printed
};

bool is_wanted(extract_state* st, const std::string& name, const std::string& file) {
  if (st->wanted.empty()) return true;
  bool wanted = false;
  for (size_t i = 0; i < st->wanted.size(); ++i) {
    if (st->wanted[i] == name || st->wanted[i] == file) wanted = st->found[i] = true;
  }
  return wanted;
}

// Flags of the names met; the bits above them count the suffixes a name has given out.
constexpr unsigned kRecordName = 1;  // a record's file name before any suffix
constexpr unsigned kWritten = 2;     // written by this run, never replaced
constexpr unsigned kSuffixStep = 4;

// The next suffixed name for base. Its count only grows and skips the names this run wrote, so
// each suffix of a base is tried once over the whole run. Without a count (the set is full) the
// record's stream offset, which no other record of the stream has.
std::string suffixed_name(extract_state* st, const std::string& base, unsigned* entry,
                          uint64_t offset) {
  if (entry == nullptr || *entry > UINT_MAX - kSuffixStep) {
    return base + "." + std::to_string(offset);
  }
  for (;;) {
    *entry += kSuffixStep;
    std::string name = base + "." + std::to_string(*entry / kSuffixStep);
    auto known = st->names.names.find(name);
    if (known == st->names.names.end() || (known->second & kWritten) == 0) return name;
  }
}

// Creates the file without following anything already there; with --force a regular file of
// an earlier run is replaced, never the read-out itself. A repeated record name, or a name this
// run wrote, takes the next suffix; once the set of names is full an existing name may be this
// run's, so it is never replaced then: one other name is tried, then the record is left out.
int create_file(extract_state* st, const std::string& base, uint64_t offset) {
  unsigned* entry = name_set_entry(&st->names, base);
  const bool repeated = entry != nullptr && (*entry & kRecordName) != 0;
  const bool taken = entry != nullptr && (*entry & kWritten) != 0;
  if (entry != nullptr) *entry |= kRecordName;
  st->file = repeated || taken ? suffixed_name(st, base, entry, offset) : base;
  const int flags = O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC;
  int fd = openat(st->dir_fd, st->file.c_str(), flags, 0644);
  if (fd >= 0 || errno != EEXIST) return fd;
  if (st->names.full) {
    if (st->file == base) {
      st->file = suffixed_name(st, base, nullptr, offset);
      fd = openat(st->dir_fd, st->file.c_str(), flags, 0644);
      if (fd >= 0 || errno != EEXIST) return fd;
    }
    errno = EEXIST;
    return -1;
  }
  if (!st->force) {
    errno = EEXIST;
    return -1;
  }
  const char* file = st->file.c_str();
  struct stat s;
  if (fstatat(st->dir_fd, file, &s, AT_SYMLINK_NOFOLLOW) == 0) {
    if (!S_ISREG(s.st_mode)) {
      errno = EPERM;
      return -1;
    }
    if (s.st_dev == st->readout_dev && s.st_ino == st->readout_ino) {
      errno = EBUSY;
      return -1;
    }
  }
  if (unlinkat(st->dir_fd, file, 0) != 0 && errno != ENOENT) return -1;
  return openat(st->dir_fd, file, flags, 0644);
}

int on_header(void* ctx, const dump_stream_record& r) {
  extract_state* st = static_cast<extract_state*>(ctx);
  const std::string name = record_name(r), base = record_file_name(r);
  if (!is_wanted(st, name, base)) return 0;
  st->fd = create_file(st, base, r.offset);
  if (st->fd < 0) {
    const std::string why = errno == EEXIST  ? "exists; --force replaces it"
                            : errno == EPERM ? "exists and is not a regular file; left alone"
                            : errno == EBUSY ? "is the read-out being read; left alone"
                                             : strerror(errno);
    st->failed = true;
    progress_end(st->prog);
    fail(std::string(st->dir) + "/" + st->file, why);
    return 0;
  }
  unsigned* written = name_set_entry(&st->names, st->file);
  if (written != nullptr) *written |= kWritten;
  const unsigned problems = record_name_problems(r);
  st->note = "";
  if (problems & NAME_NO_TERMINATOR) {
    st->note = "the name \"" + printable(name) + "\" has no terminator";
  } else if (problems & NAME_UNSAFE) {
    st->note = "the name \"" + printable(name) + "\" is not a safe file name";
  }
  if (st->file != base) {
    st->note += (st->note.empty() ? "\"" : "; \"") + printable(base) + "\" is taken";
  }
  return 0;
}

int on_content(void* ctx, const uint8_t* data, size_t length) {
  extract_state* st = static_cast<extract_state*>(ctx);
  if (st->fd < 0 || write_all(st->fd, data, length) == 0) return 0;
  progress_end(st->prog);
  fail(std::string(st->dir) + "/" + st->file, std::string("write failed: ") + strerror(errno));
  close(st->fd);
  st->fd = -1;
  st->failed = true;
  return -1;
}

int on_record_end(void* ctx, const dump_stream_record& r, bool complete, uint64_t received) {
  extract_state* st = static_cast<extract_state*>(ctx);
  if (st->fd < 0) return 0;
  const std::string path = std::string(st->dir) + "/" + st->file;
  const int closed = close(st->fd);
  st->fd = -1;
  if (closed != 0) {
    st->failed = true;
    progress_end(st->prog);
    fail(path, std::string("write failed: ") + strerror(errno));
    return -1;
  }
  std::string line = printable(st->file) + ": ";
  if (complete) {
    line += std::to_string(r.size) + " bytes";
  } else {
    line += std::to_string(received) + " of " + std::to_string(r.size) + " bytes, incomplete";
    st->failed = true;
  }
  if (!st->note.empty()) line += " (" + st->note + ")";
  progress_end(st->prog);
  printf("%s\n", line.c_str());
  if (!complete) {
    fail(path, "the data ends inside its record, after " + std::to_string(received) + " of " +
                   std::to_string(r.size) + " bytes");
  }
  return 0;
}

}  // namespace

int cmd_extract(int argc, char** argv) {
  if (wants_help(argc, argv)) {
    fputs(kUsage, stdout);
    return kExitOk;
  }
  extract_state st = {};
  st.fd = -1;
  static const char* const kFlags[] = {"--force", nullptr};
  unsigned seen;
  std::vector<const char*> operands;
  if (!split_args(argc, argv, kFlags, kUsage, &seen, &operands)) return kExitUsage;
  st.force = seen != 0;
  if (operands.size() < 2) return usage_error(kUsage, "extract takes OUTPUT and DIR");
  const char* path = operands[0];
  st.dir = operands[1];
  st.wanted.assign(operands.begin() + 2, operands.end());
  st.found.assign(st.wanted.size(), false);

  // Opened first, so that an unreadable read-out leaves no directory behind.
  readout_reader reader;
  if (readout_open(&reader, path, "extract") != 0) return kExitBad;
  struct stat in;
  if (fstat(reader.fd, &in) != 0) {
    fail(path, strerror(errno));
    readout_close(&reader);
    return kExitBad;
  }
  st.readout_dev = in.st_dev;
  st.readout_ino = in.st_ino;
  // A trailing slash would make the last component be followed when it is a symbolic link.
  std::string dir = st.dir;
  while (dir.size() > 1 && dir.back() == '/') dir.pop_back();
  st.dir = dir.c_str();
  if (mkdir(st.dir, 0755) != 0 && errno != EEXIST) {
    fail(st.dir, std::string("cannot be created: ") + strerror(errno));
    readout_close(&reader);
    return kExitBad;
  }
  st.dir_fd = open(st.dir, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
  if (st.dir_fd < 0) {
    // O_DIRECTORY fails a symbolic link as ENOTDIR before O_NOFOLLOW can say ELOOP.
    const int error = errno;
    struct stat link;
    const bool is_link =
        error == ELOOP || (error == ENOTDIR && lstat(st.dir, &link) == 0 && S_ISLNK(link.st_mode));
    fail(st.dir, is_link            ? "is a symbolic link, which is not followed"
                 : error == ENOTDIR ? "is not a directory"
                                    : strerror(error));
    readout_close(&reader);
    return kExitBad;
  }
  st.prog = &reader.prog;
  dump_stream stream;
  dump_stream_init(&stream);
  const int rc =
      readout_parse(&reader, &stream, {&st, on_header, on_content, on_record_end}, nullptr);
  if (st.fd >= 0) close(st.fd);  // a write failure ended the run
  close(st.dir_fd);
  fflush(stdout);
  int status = readout_close(&reader);
  if (rc < 0 || st.failed) status = kExitBad;
  if (stream.state == STREAM_CUT_HEADER) {
    status = fail(path, dump_stream_end_text(stream) + " at stream offset " +
                            std::to_string(stream.end_offset));
  }
  for (size_t w = 0; w < st.wanted.size(); ++w) {
    if (!st.found[w]) status = fail(path, "no record named \"" + printable(st.wanted[w]) + "\"");
  }
  return status;
}
