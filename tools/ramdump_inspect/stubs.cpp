// Placeholders while the commands are written; each moves to its own file.
#include "tools/ramdump_inspect/cli.h"
#include "tools/ramdump_inspect/commands.h"

int cmd_misc(int, char**) { return fail("misc", "not written yet"); }
int cmd_verify(int, char**) { return fail("verify", "not written yet"); }
