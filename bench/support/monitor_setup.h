// What the benchmarks set up before they call the monitor's routines as a pass would.
#pragma once

#include <cstdint>
#include <string>
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

// Above the benchmarks' own 4 GiB and anything else on this machine, below the size guard.
inline constexpr int32_t RSS_OUT_OF_REACH = 8000000;
// Tenths of a percent of the machine: no sum of shares comes near it.
inline constexpr int32_t APPLIANCE_CPU_OUT_OF_REACH = 100000;

// Writes to `path` the example control file for a monitor that runs thousands of passes on this
// shared machine: the resident size of a process out of reach, no kill limit (nothing here can be
// told to die), the CPU of the appliance as a whole (here the whole machine, kept busy by whoever
// else compiles on it) out of reach, and a trend that is never reported: passes that follow each
// other within a fraction of a second find every process that grows for a second (a compiler)
// growing at every step, which passes minutes apart would not. The analysis still walks every row
// at every snapshot. False when the example lacks one of them or the file cannot be written.
bool write_long_run_control_file(const std::string &path);

// The monitor of a benchmark: a private IPC namespace, a temporary data directory, the settings
// and tables of the example control file, then the control block; says what failed on standard
// error.
bool set_up_monitor();

// What the loop does to primaryDataBlock before the checks of a pass.
void start_pass();

// The command line, null-terminated, with "--benchmark_filter=-<name>" added unless it names a
// filter of its own: for a benchmark that runs only when asked for by name, and then alone.
std::vector<char *> unless_named(int argc, char **argv, const char *name);
