// A fake /proc tree for the process CPU accounting, and a stepped clock: while a fake_proc lives,
// the accounting reads its processor count and its processes from a temporary directory and
// takes its clock ticks and tick rate from here.
#pragma once

#include <cstdint>
#include <ctime>
#include <string>
#include <string_view>

namespace fake {

class fake_proc {
  public:
    // An empty tree (no cpuinfo, no processes), the clock at `ticks`, `hertz` ticks a second.
    explicit fake_proc(clock_t ticks = 1000, long hertz = 100);
    ~fake_proc();
    fake_proc(const fake_proc &) = delete;
    fake_proc &operator=(const fake_proc &) = delete;

    const std::string &root() const { return root_; }

    // cpuinfo with `count` processor lines in the kernel's layout ("processor\t: 0").
    void set_cpus(int count);
    void set_cpuinfo(std::string_view text);
    void remove_cpuinfo();

    // A process whose stat line has these values and the kernel's usual ones elsewhere; `name`
    // is given without its parentheses.
    void set_process(int pid, std::string_view name, uint32_t utime, uint32_t stime,
                     int priority = 20, int nice = 0);
    // A process whose stat file holds exactly `text`.
    void set_stat_text(int pid, std::string_view text);
    // The pid's directory stays, its stat file goes: opening it fails with ENOENT.
    void remove_stat(int pid);
    void remove_process(int pid);
    // A directory entry that is not a process ("self", "sys", "cpuinfo" are of that kind).
    void add_other_directory(std::string_view name);

    void set_ticks(clock_t ticks);
    void advance(clock_t ticks);
    clock_t ticks() const;

  private:
    std::string root_;
    const char *saved_root_;
    clock_t (*saved_ticks_)();
    long (*saved_rate_)();
};

// The stat line the kernel would write for such a process.
std::string stat_line(int pid, std::string_view name, uint32_t utime, uint32_t stime,
                      int priority = 20, int nice = 0);

} // namespace fake
