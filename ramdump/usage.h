#pragma once

// Writes the usage text to standard error; program is argv[0] as invoked.
void print_usage(const char* program);
