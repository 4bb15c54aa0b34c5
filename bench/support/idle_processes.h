// Idle children that only make the process table longer, for benchmarks at a given process count;
// started with posix_spawn and ended by their pids.
#pragma once

#include <cstddef>
#include <sys/types.h>
#include <vector>

class idle_processes {
  public:
    idle_processes() = default;
    ~idle_processes() { resize(0); }
    idle_processes(const idle_processes &) = delete;
    idle_processes &operator=(const idle_processes &) = delete;

    // Starts or ends children until `count` are running; each new child holds `descriptors` open
    // descriptors (its standard three, then /dev/null up to that count).
    void resize(size_t count, int descriptors = 3);

  private:
    std::vector<pid_t> pids_;
};

// The pids in /proc now.
int pids_in_proc();

// One open, read and close of every /proc/<pid>/stat, from a scan of /proc: the least that a
// sample of every process's CPU time can cost. Returns the pids seen.
int bare_stat_reads();
