// What the benchmarks set up before they call the monitor's routines as a pass would.
#pragma once

#include <vector>

// Moves the program into an IPC namespace of its own, so that the control block it makes never
// touches that of a monitor on this host; says why on standard error and returns false when the
// machine does not allow it (it needs root).
bool enter_private_ipc();

// Points the default platform's data directory (its trace file) at a new temporary directory,
// unless TELV_DATA_DIR is already set.
void use_temporary_data_dir();

// The settings and tables of the example control file, as the monitor reads them at start.
bool load_example_control_file();

// The monitor of a benchmark: a private IPC namespace, a temporary data directory, the settings
// and tables of the example control file, then the control block; says what failed on standard
// error.
bool set_up_monitor();

// What the loop does to primaryDataBlock before the checks of a pass.
void start_pass();

// The command line, null-terminated, with "--benchmark_filter=-<name>" added unless it names a
// filter of its own: for a benchmark that runs only when asked for by name, and then alone.
std::vector<char *> unless_named(int argc, char **argv, const char *name);
