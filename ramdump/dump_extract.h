// Pulling one named file out of the dump stream that the firmware left in a read-out.
//
// The read-out holds the chain blocks in chain order, each a 16-byte chain block header and
// its payload. The payloads joined together are the dump stream: dump_file_records, each
// followed by the file's content. The extraction walks the read-out in 4096-byte units and
// hands each payload to a stream filter that writes the wanted record's content to a file.
#pragma once

#include <stdint.h>
#include <stdio.h>

// The stream filter. Consumes length bytes of the dump stream and returns how many bytes at
// the end it could not use yet (0 to 39: the start of an incomplete record header); the caller
// presents them again, followed by the next data, on the next call. Returns -1 on a record
// header with a bad magic, an output file that cannot be opened, or a failed write.
//
// *out is the open output stream while the wanted record's content is being written and null
// otherwise; when the filter fails the caller closes it. The wanted record's content goes to
// out_dir + "/" + record name. The filter's position in the stream (header or content, bytes
// of content still to come, the current record header) is process-wide and survives between
// calls: one process extracts from one stream.
int64_t process_data_filtered(const uint8_t* data, int64_t length, FILE** out,
                              const char* wanted_name, const char* out_dir);

// Writes the record named "RAMDUMP_MSG.txt" of the dump stream in the read-out file to
// out_dir. Failures are printed on standard error and end the extraction; the result is
// always 0.
int extract_ramdump_msg(const char* readout_path, const char* out_dir);

// Puts the process-wide filter back into its start state (header phase, nothing pending).
// For tests only, which feed several streams through one process: the tool never calls it.
void reset_dump_filter_state_for_test();
