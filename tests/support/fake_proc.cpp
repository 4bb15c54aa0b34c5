#include "fake_proc.h"

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>

#include "cpu/process_listing.h"

namespace fake {
namespace {

clock_t stepped_ticks;
long stepped_hertz;

clock_t read_stepped_ticks() {
    return stepped_ticks;
}
long read_stepped_hertz() {
    return stepped_hertz;
}

void write_file(const std::string &path, std::string_view contents) {
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    out.write(contents.data(), static_cast<std::streamsize>(contents.size()));
    if (!out) {
        std::fprintf(stderr, "fake_proc: cannot write %s\n", path.c_str());
        std::abort();
    }
}

} // namespace

fake_proc::fake_proc(clock_t ticks, long hertz)
    : saved_root_(proc_root), saved_ticks_(clock_tick_source), saved_rate_(clock_tick_rate_source) {
    char pattern[] = "/tmp/tarn-proc-XXXXXX";
    if (mkdtemp(pattern) == nullptr) {
        std::perror("mkdtemp");
        std::abort();
    }
    root_ = pattern;
    stepped_ticks = ticks;
    stepped_hertz = hertz;
    proc_root = root_.c_str();
    clock_tick_source = read_stepped_ticks;
    clock_tick_rate_source = read_stepped_hertz;
}

fake_proc::~fake_proc() {
    proc_root = saved_root_;
    clock_tick_source = saved_ticks_;
    clock_tick_rate_source = saved_rate_;
    std::error_code ignored;
    std::filesystem::remove_all(root_, ignored);
}

void fake_proc::set_cpus(int count) {
    std::string text;
    for (int i = 0; i < count; ++i) {
        text += "processor\t: " + std::to_string(i) +
                "\nvendor_id\t: SomeVendor\ncpu MHz\t\t: " + "2400.000\n\n";
    }
    set_cpuinfo(text);
}

void fake_proc::set_cpuinfo(std::string_view text) {
    write_file(root_ + "/cpuinfo", text);
}

void fake_proc::remove_cpuinfo() {
    std::filesystem::remove(root_ + "/cpuinfo");
}

void fake_proc::set_process(int pid, std::string_view name, uint32_t utime, uint32_t stime,
                            int priority, int nice) {
    set_stat_text(pid, stat_line(pid, name, utime, stime, priority, nice));
}

void fake_proc::set_stat_text(int pid, std::string_view text) {
    std::string directory = root_ + "/" + std::to_string(pid);
    std::filesystem::create_directories(directory);
    write_file(directory + "/stat", text);
}

void fake_proc::remove_stat(int pid) {
    std::filesystem::remove(root_ + "/" + std::to_string(pid) + "/stat");
}

void fake_proc::remove_process(int pid) {
    std::filesystem::remove_all(root_ + "/" + std::to_string(pid));
}

void fake_proc::add_other_directory(std::string_view name) {
    std::filesystem::create_directories(root_ + "/" + std::string(name));
}

void fake_proc::set_ticks(clock_t ticks) {
    stepped_ticks = ticks;
}

void fake_proc::advance(clock_t ticks) {
    stepped_ticks += ticks;
}

clock_t fake_proc::ticks() const {
    return stepped_ticks;
}

std::string stat_line(int pid, std::string_view name, uint32_t utime, uint32_t stime, int priority,
                      int nice) {
    char text[1024];
    std::snprintf(text, sizeof text,
                  "%d (%.*s) S 1 %d %d 0 -1 4194560 1523 0 12 0 %u %u 0 0 %d %d 1 0 4242 "
                  "12582912 812 18446744073709551615 94016 94812 140722 0 0 0 0 4096 17642 0 0 "
                  "0 17 1 0 0 0 0 0 94901 94956 95008 140722 140723 140723 140724 0\n",
                  pid, static_cast<int>(name.size()), name.data(), pid, pid, utime, stime, priority,
                  nice);
    return text;
}

} // namespace fake
