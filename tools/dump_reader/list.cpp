// ramdump_inspect list: the records of the dump stream in a read-out, printed as they end so
// that any number of them takes constant memory.
#include <inttypes.h>
#include <stdio.h>
#include <string.h>

#include <string>

#include "tools/dump_reader/cli.h"
#include "tools/dump_reader/commands.h"
#include "tools/dump_reader/dump_stream.h"
#include "tools/dump_reader/readout_reader.h"

namespace {

const char kUsage[] =
    "usage: ramdump_inspect list [--json] OUTPUT\n"
    "Lists the records of the dump stream in a read-out (RAMDUMP_OUTPUT): the payloads of its\n"
    "4096-byte units joined, record headers and contents reassembled across unit boundaries.\n"
    "\n"
    "For each record: the stream offset of its header, its size and name, and notes: incomplete\n"
    "(the data ends inside it), a name without terminator or with characters unsafe in a file\n"
    "name, a repeated name. Then where the stream ends and why (a record header whose magic is\n"
    "not \"F1Le\", or the end of the data), and whether the tool's own extraction at boot writes\n"
    "RAMDUMP_MSG.txt completely from this read-out: it reassembles a record header that starts\n"
    "17 to 39 bytes before the end of a unit wrongly, and normally stops there.\n"
    "\n"
    "The first unit whose chain block magic is not \"BCho\" ends the data, as it ends the tool's\n"
    "extraction; a partial last unit is ignored. Both are reported on standard error.\n"
    "\n"
    "  --json   one JSON object: \"records\" (each with \"name\", \"size\", \"offset\",\n"
    "           \"complete\", \"notes\"), \"end\" (\"offset\", \"reason\": \"bad_magic\",\n"
    "           \"end_of_data\" (between records), \"cut_header\", \"cut_record\" (the data\n"
    "           ends inside a record header or content), \"bad_chain_magic\" or \"read_error\",\n"
    "           and \"detail\") and\n"
    "           \"device_extracts_message\" (true or false)\n"
    "\n"
    "Exit status: 0 when the stream was read to a clean end (a record header with a bad magic,\n"
    "or the end of the data between records), 1 when the data ends inside a record, the\n"
    "read-out is damaged or cannot be read, 2 on a usage error.\n";

struct list_state {
  bool json;
  uint64_t printed;
  name_set names;
  progress* prog;  // cleared before a record is printed
};

int print_record(void* ctx, const dump_stream_record& r, bool complete, uint64_t received) {
  list_state& st = *static_cast<list_state*>(ctx);
  const std::string name = record_name(r);
  std::string notes;  // as a JSON array, or as text
  auto note = [&](const std::string& text) {
    if (st.json) {
      notes += (notes.empty() ? "" : ", ") + json_string(text);
    } else {
      notes += "  [" + text + "]";
    }
  };
  if (!complete) note("incomplete: " + std::to_string(received) + " bytes");
  const unsigned problems = record_name_problems(r);
  if (problems & NAME_NO_TERMINATOR) note("no terminator");
  if (problems & NAME_UNSAFE) note("unsafe file name");
  unsigned* seen = name_set_entry(&st.names, name);
  if (seen != nullptr && (*seen)++ > 0) note("repeated name");
  progress_end(st.prog);
  if (st.json) {
    printf("%s\n  {\"name\": %s, \"size\": %" PRIu64 ", \"offset\": %" PRIu64
           ", \"complete\": %s, \"notes\": [%s]}",
           st.printed == 0 ? "" : ",", json_string(name).c_str(), r.size, r.offset,
           complete ? "true" : "false", notes.c_str());
  } else {
    if (st.printed == 0) printf("%12s %20s  %s\n", "OFFSET", "SIZE", "NAME");
    printf("%12" PRIu64 " %20" PRIu64 "  %s%s\n", r.offset, r.size, printable(name).c_str(),
           notes.c_str());
  }
  ++st.printed;
  return 0;
}

// What the tool's extraction makes of the read-out, in words.
std::string device_text(const device_extraction& d, const dump_stream& s) {
  if (d.message_complete) return "writes RAMDUMP_MSG.txt completely";
  const bool early = d.stopped && (s.state != STREAM_BAD_MAGIC || d.stop_offset < s.end_offset);
  const std::string where = early ? "stops at stream offset " + std::to_string(d.stop_offset) : "";
  if (d.message_open) return "leaves RAMDUMP_MSG.txt incomplete" + (early ? ": " + where : "");
  return early ? where + ", without RAMDUMP_MSG.txt" : "finds no RAMDUMP_MSG.txt";
}

}  // namespace

int cmd_list(int argc, char** argv) {
  if (wants_help(argc, argv)) {
    fputs(kUsage, stdout);
    return kExitOk;
  }
  list_state st = {false, 0, {}, nullptr};
  static const char* const kFlags[] = {"--json", nullptr};
  unsigned seen;
  std::vector<const char*> operands;
  if (!split_args(argc, argv, kFlags, kUsage, &seen, &operands)) return kExitUsage;
  st.json = seen != 0;
  if (operands.size() != 1) return usage_error(kUsage, "list takes one OUTPUT");
  const char* path = operands[0];

  readout_reader reader;
  if (readout_open(&reader, path, "list") != 0) return kExitBad;
  st.prog = &reader.prog;
  dump_stream stream;
  dump_stream_init(&stream);
  device_extraction device;
  device_extraction_init(&device);
  if (st.json) printf("{\"records\": [");
  readout_parse(&reader, &stream, {&st, nullptr, nullptr, print_record}, &device);

  // The data ending early is the reason unless the stream had ended before it.
  std::string reason = dump_stream_end_token(stream), detail = dump_stream_end_text(stream);
  if (stream.state != STREAM_BAD_MAGIC && !readout_stop_text(reader).empty()) {
    reason = reader.bad_chain_magic ? "bad_chain_magic" : "read_error";
    detail =
        readout_stop_text(reader) + (stream.state == STREAM_END_OF_DATA ? "" : " (" + detail + ")");
  }
  const bool cut = stream.state == STREAM_CUT_HEADER || stream.state == STREAM_CUT_CONTENT;
  if (st.json) {
    printf("%s], \"end\": {\"offset\": %" PRIu64
           ", \"reason\": %s, \"detail\": %s}, "
           "\"device_extracts_message\": %s}\n",
           st.printed == 0 ? "" : "\n", stream.end_offset, json_string(reason).c_str(),
           json_string(detail).c_str(), device.message_complete ? "true" : "false");
  } else {
    if (st.printed == 0) printf("no records\n");
    printf("end of the stream at offset %" PRIu64 ": %s\n", stream.end_offset, detail.c_str());
    printf("the tool's extraction %s\n", device_text(device, stream).c_str());
    if (st.names.full) {
      printf("repeated names checked among the first %zu names only\n", name_set::kMaxNames);
    }
  }
  fflush(stdout);
  int status = readout_close(&reader);
  if (cut && readout_stop_text(reader).empty()) {
    status = fail(path, detail + " at stream offset " + std::to_string(stream.end_offset));
  }
  return cut ? kExitBad : status;
}
