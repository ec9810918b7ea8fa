// The directory of the boot-time run's files, /data/vendor/ramdump. init creates it for the
// tool; its parents are trusted, the directory itself is opened without following a link, and
// every file in it is reached through that descriptor. It also serializes the runs that work
// on the reserved file and the misc items.
#pragma once

#include "ramdump/file_ref.h"

// The directory, opened once per process; -1 with errno set when it cannot be opened (missing,
// a link, not a directory), in which case every step in it fails as for a missing directory.
int ramdump_dir();

// A file of the directory, by its name and its path for messages.
file_ref in_ramdump_dir(const char* name, const char* path);

// Takes an exclusive lock on the directory, held until the process ends, waiting up to two
// minutes for another run that holds it. Returns 0, also without the directory (there is
// nothing to guard then), or -1 after logging why the lock was not obtained.
int lock_ramdump_dir();

// Whether the block file as typed is the reserved file (or, before -c creates it, names it).
bool is_reserved_file(const char* path);

// Deletes the last collected dump: the output and message files and the output directory
// (apq/00). Results are ignored.
void remove_collected_dump();

// Deletes the last dump and creates apq and apq/00 again (mode 0777, results ignored). Returns
// apq/00 opened, or -1 with errno set.
int recreate_output_dir();
