// ramdump_inspect: opens what the tool collected (the read-out file, the chain on a raw device,
// the misc items) on a workstation or a device. Each command parses its own arguments (argv[0]
// is the command's name) and returns the process exit status: 0 when everything it checked
// holds, 1 on bad or unreadable input, 2 on a usage error.
#pragma once

int cmd_misc(int argc, char** argv);
int cmd_verify(int argc, char** argv);
int cmd_list(int argc, char** argv);
int cmd_extract(int argc, char** argv);
int cmd_strip(int argc, char** argv);
