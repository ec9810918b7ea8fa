// Placeholders while the commands are written; each moves to its own file.
#include "tools/ramdump_inspect/cli.h"
#include "tools/ramdump_inspect/commands.h"

int cmd_misc(int, char**) { return fail("misc", "not written yet"); }
int cmd_verify(int, char**) { return fail("verify", "not written yet"); }
int cmd_list(int, char**) { return fail("list", "not written yet"); }
int cmd_extract(int, char**) { return fail("extract", "not written yet"); }
int cmd_strip(int, char**) { return fail("strip", "not written yet"); }
