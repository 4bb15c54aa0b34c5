#include "core/monitor_loop.h"

#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <sys/sysinfo.h>
#include <unistd.h>

#include "capture/snapshot_file.h"
#include "core/alert_switches.h"
#include "core/control_block.h"
#include "core/control_file.h"
#include "core/pass_figures.h"
#include "core/problem_reporting.h"
#include "core/reason_codes.h"
#include "core/settings.h"
#include "core/validation.h"
#include "core/words.h"
#include "cpu/performance.h"
#include "cpu/process_listing.h"
#include "data_blocks.h"
#include "filesvc.h"
#include "memory/pp_memory.h"
#include "memory/system_memory.h"
#include "memory/trend_analysis.h"
#include "storage/file_system.h"
#include "storage/open_files.h"
#include "tracesvc.h"

char fileData[FILE_DATA_SIZE];

namespace {

long system_uptime() {
    struct sysinfo info {};
    sysinfo(&info);
    return info.uptime;
}

void sleep_one_second() {
    sleep(1);
}

constexpr uint32_t REPORT_SRC = 2; // the system return code of the loop's events
constexpr int KILL_SIGNALS[] = {SIGABRT, SIGSEGV, SIGKILL};
constexpr char FRAME_LINE[] = "  \n\r";

// The open mode, access, share and options of the control file's open: an existing file, read.
constexpr uint32_t OPEN_EXISTING = 0;
constexpr uint32_t READ_ACCESS = 1;
constexpr uint32_t CONTROL_FILE_SHARE = 1;
constexpr uint32_t CONTROL_FILE_OPTIONS = 64;

// What a run keeps between its passes: the loop's integers the checks write through.
struct monitor_run {
    int32_t takeLogCrc = 0;
    int32_t takeLogValue = 0;
    int32_t killPid = 0;
    int32_t memoryPercentLogged = 0;
    uint32_t crc = 0;
    uint32_t src = 0;
    int32_t runOnce = 0;
    int32_t keepRunning = 1;
    int32_t NumIterationsSinceLastSnapshot = 0;
    uint64_t passes = 0;
    bool slept = false; // a second of the sleep before this pass was measured
    filesvc_handle_t handle = 0;
    tarn_control_block *block = nullptr;
};

bool is_kill_code(int32_t code) {
    return code == RC_PROCESS_RSS_ABORT || code == RC_RESERVED_KILL_1 || code == RC_RESERVED_KILL_2;
}

// A separator line, which the snapshot writer consumes: its own copy every time.
void save_separator(std::string_view separator, int32_t final) {
    char text[64];
    std::memcpy(text, separator.data(), separator.size());
    text[separator.size()] = '\0';
    tarn_save_data(text, file_buffer, FILE_BUFFER_SIZE, final);
}

void start(monitor_run &run, int32_t argc, char **argv) {
    tracesvc_trace("TARNMNDF:    argc = %d", argc);
    for (int32_t i = 0; i < argc; ++i) {
        tracesvc_trace("TARNMNDF:    argv[%d] = >%s<", i, argv[i]);
    }
    settings_start_values();
    // The history of an earlier run in this process goes, not only its header.
    delete_process_list(&process_list);
    std::memset(&process_list, 0, sizeof process_list);
    process_list_ptr = &process_list;
    run.killPid = 0;
    if (argc > 1) {
        manualStart = 1;
        tracesvc_trace("TARNMNDF:    input parm: checking_interval = %s", argv[1]);
        checking_interval = read_number(argv[1]);
        tracesvc_trace("TARNMNDF:    checking_interval Point 0010 = %d seconds", checking_interval);
        if (checking_interval < CHECKING_INTERVAL_MINIMUM) {
            checking_interval = CHECKING_INTERVAL_DEFAULT;
        }
        if (argc > 2) {
            run.runOnce = 1;
        }
    }
    tracesvc_trace("TARNMNDF:    checking_interval = %d seconds", checking_interval);
    tracesvc_trace(run.runOnce == 1 ? "TARNMNDF:    runOnce = TRUE"
                                    : "TARNMNDF:    runOnce = FALSE");
}

// Reads and parses the control file, then validates the settings. True when the monitor is to run.
bool read_control_file(monitor_run &run) {
    std::memset(fileData, 0, FILE_DATA_SIZE);
    uint32_t bytes_read = 0;
    uint32_t info = 0;
    uint32_t rc = filesvc_random_read(run.handle, fileData, FILE_DATA_SIZE, 0, 0, &bytes_read,
                                      &info, &run.crc);
    if (rc != 0 || bytes_read < CONTROL_FILE_MIN) {
        tracesvc_trace("TARNMNDF: Error on filesvc_random_read");
        run.src = tarn_mon_error_handler(rc | REPORT_SRC, run.crc, RC_CONTROL_FILE_READ);
        return false;
    }
    fileData[FILE_DATA_SIZE - 1] = '\0';
    run.src = tarn_parse_control_file(fileData, &run.crc);
    // A file that did not ask to run, or whose settings fail a rule, ends the monitor silently.
    return run_requested() == 1 && run.src == 0 && validate_settings() == nullptr;
}

void call_external_routines() {
    tracesvc_trace("TARNMNDF: num_external_calls = %d", num_external_calls);
    if (calllist1 == nullptr) {
        return;
    }
    for (int32_t i = 0; i < num_external_calls; ++i) {
        const external_call &entry = calllist1[i];
        if (entry.address == nullptr) {
            continue;
        }
        tracesvc_trace("TARNMNDF: about to call %s", entry.name);
        char *returnedData = nullptr;
        reinterpret_cast<external_check_routine>(entry.address)(fileData, &returnedData);
        if (returnedData == nullptr) {
            continue;
        }
        // The frame's lines are headers: their lengths are added to the room left, as the
        // header rule has always had it; only the routine's text is taken from it.
        append_header_line(FRAME_LINE);
        std::snprintf(line, LINE_SIZE, "About to output data from function %s \n\r", entry.name);
        append_header_line(line);
        tracesvc_trace("TARNMNDF: length of caller's data is %d",
                       static_cast<int32_t>(std::strlen(returnedData)));
        tracesvc_trace("TARNMNDF: caller's data is [%s]", returnedData);
        append_data_line(returnedData);
        append_header_line(FRAME_LINE);
        std::snprintf(line, LINE_SIZE, "Done outputting data from function %s \n\r", entry.name);
        append_header_line(line);
    }
}

void run_checks(monitor_run &run) {
    uint32_t *tookLog = &run.block->tookLog;
    run.src =
        tarn_check_pp_memory(&run.takeLogCrc, &run.takeLogValue, &run.killPid, tookLog, &run.crc);
    run.src = tarn_check_system_memory(&run.takeLogCrc, &run.takeLogValue, tookLog,
                                       &run.memoryPercentLogged, &run.crc);
    run.src = tarn_check_file_system(&run.takeLogCrc, &run.takeLogValue, tookLog, &run.crc);
    run.src = tarn_check_open_files(&run.takeLogCrc, &run.takeLogValue, tookLog, &run.crc);
    run.src = tarn_check_performance(&run.takeLogCrc, &run.takeLogValue, tookLog, &run.crc);
}

// The problem snapshot, the event with the pass's data, and the kill of a process over its abort
// limit.
void report_problem(monitor_run &run) {
    tarn_control_block &block = *run.block;
    tracesvc_trace("TARNMNDF: Output FEDC snapshot data, including top");
    save_separator(PROBLEM_SNAPSHOT_OPENING, 0);
    tarn_add_timestamp();
    // Copied before staging, which empties the text it is given.
    copy_error_text_to_log();
    tarn_save_data(topDataBlock, file_buffer, FILE_BUFFER_SIZE, 0);
    tarn_save_data(primaryDataBlock, file_buffer, FILE_BUFFER_SIZE, 0);
    save_separator(PROBLEM_SNAPSHOT_CLOSING, 1);
    bool kill_process = is_kill_code(run.takeLogCrc) && run.killPid != 0;
    if (kill_process) {
        tracesvc_trace("TARNMNDF: going to kill process %d (dec)", run.killPid);
    }
    if (run.takeLogCrc == RC_EXTRA_PARTITION_SPACE) {
        tracesvc_trace("TARNMNDF:setting the log info as TRUE");
        write_field(block.logAsInfo, 1);
    }
    // Staging left a NUL at the start of the pass's data; a blank makes the rest of it the event's
    // data again, and the NUL goes back afterwards.
    primaryDataBlock[0] = ' ';
    tarn_mon_error_handler_p(REPORT_SRC, static_cast<uint32_t>(run.takeLogValue), primaryDataBlock,
                             static_cast<uint32_t>(run.takeLogCrc));
    primaryDataBlock[0] = '\0';
    write_field(block.tookLog, 1);
    if (run.takeLogCrc == RC_EXTRA_PARTITION_SPACE) {
        // A full /extra is information only, and never holds back the reports that follow.
        tracesvc_trace("TARNMNDF:setting the log info as False && extraSRC flag as true");
        write_field(block.logAsInfo, 0);
        extraFileSystemSRCOn = 1;
        write_field(block.tookLog, 0);
    }
    tracesvc_trace("TARNMNDF: takeLogCrc after log is %x (hex)", run.takeLogCrc);
    if (kill_process) {
        tracesvc_trace("TARNMNDF: about to kill process %d (dec)", run.killPid);
        for (int signal : KILL_SIGNALS) {
            kill(run.killPid, signal);
        }
    }
}

void write_plain_snapshot() {
    save_separator(PLAIN_SNAPSHOT_OPENING, 0);
    tarn_add_timestamp();
    tarn_save_data(primaryDataBlock, file_buffer, FILE_BUFFER_SIZE, 0);
    save_separator(PLAIN_SNAPSHOT_CLOSING, 1);
}

// Sleeps the checking interval one second at a time. Once CPU checking is armed, a sleep that is
// to take longer than allowed (it is measured against the uptime after every second) is ended at
// once and flagged for the performance check of the next pass. True when a second was measured.
bool sleep_measured(tarn_control_block &block) {
    tracesvc_trace("TARNMNDF: about to sleep for %d seconds", checking_interval);
    long start = uptime_source();
    int32_t secondsLeft = checking_interval;
    write_field(block.sleep_time_percent, -1);
    bool measured = false;
    while (secondsLeft != 0 && read_field(block.sleepTimeExceeded) == 0) {
        measured = true;
        one_second_sleep();
        --secondsLeft;
        tracesvc_trace("TARNMNDF: slept for 1 second; %d seconds left", secondsLeft);
        long now = uptime_source();
        telvzmnd_sleep_time = wrap32(int64_t{secondsLeft} + wrap32(now - start));
        int32_t max_sleep = wrap32(int64_t{cpu_sleep_time_threshold} * checking_interval) / 1000;
        write_field(block.maxSleepTime, max_sleep);
        tracesvc_trace("TARNMNDF: anticipated sleep time is %d (dec)", telvzmnd_sleep_time);
        tracesvc_trace("TARNMNDF: max sleep time is %d (dec)", max_sleep);
        if (max_sleep < telvzmnd_sleep_time && read_field(block.numLoopsBeforeCPUChecking) == 0) {
            int32_t percent = SLEEP_PERCENT_NOTHING_SLEPT;
            if (secondsLeft != checking_interval) {
                auto product = static_cast<uint32_t>(wrap32(int64_t{telvzmnd_sleep_time} * 100));
                auto slept =
                    static_cast<uint32_t>(wrap32(int64_t{checking_interval} - secondsLeft));
                percent = static_cast<int32_t>(product / slept);
            }
            write_field(block.sleep_time_percent, percent);
            write_field(block.sleepTimeExceeded, 1);
            tracesvc_trace("TARNMNDF: TARN_CB_PTR->sleep_time_percent Point 0020 is %d (dec)",
                           percent);
        }
    }
    return measured;
}

// What the pass found and how long it took, with what the checks noted, to the observer.
void publish_figures(const monitor_run &run, std::chrono::steady_clock::time_point started) {
    auto took = std::chrono::steady_clock::now() - started;
    bool held_back = run.takeLogCrc == static_cast<int32_t>(TAKE_LOG_SUPPRESSED);
    publish_pass_figures(
        {static_cast<uint64_t>(std::chrono::duration_cast<std::chrono::nanoseconds>(took).count()),
         held_back ? 0 : run.takeLogCrc, held_back, run.slept, telvzmnd_sleep_time,
         checking_interval});
}

void run_pass(monitor_run &run) {
    auto started = std::chrono::steady_clock::now();
    tracesvc_trace("TARNMNDF: inside while loop");
    start_pass_figures(++run.passes);
    start_pass_data();
    run.takeLogCrc = 0;
    run.takeLogValue = 0;
    run.killPid = 0;

    run_checks(run);
    call_external_routines();
    std::memcpy(oldPSDataBlock, newPSDataBlock, std::strlen(newPSDataBlock) + 1);

    tracesvc_trace("TARNMNDD: takeLogCrc = %d (dec)", run.takeLogCrc);
    tracesvc_trace("TARNMNDD: tookLog = %d (dec)", read_field(run.block->tookLog));
    if (run.takeLogCrc == 0) {
        // A clean pass re-arms reporting.
        write_field(run.block->tookLog, 0);
        run.memoryPercentLogged = 0;
    } else if (run.takeLogCrc != static_cast<int32_t>(TAKE_LOG_SUPPRESSED)) {
        report_problem(run);
    }

    ++run.NumIterationsSinceLastSnapshot;
    tracesvc_trace("TARNMNDF: NumIterationsSinceLastSnapshot = %d (dec)",
                   run.NumIterationsSinceLastSnapshot);
    tracesvc_trace("TARNMNDF: snapshot_interval = %d (dec)", snapshot_interval);
    if (snapshot_interval > 0 && run.NumIterationsSinceLastSnapshot >= snapshot_interval) {
        if (trend_analysis_points > 0) {
            tracesvc_trace("TARNMNDF: Perform trend analysis");
            run.src = tarn_trend_analysis(&run.crc);
        }
        tracesvc_trace("TARNMNDF: Output snapshot data");
        write_plain_snapshot();
        run.NumIterationsSinceLastSnapshot = 0;
    }
    publish_figures(run, started);

    if (run.runOnce == 1 || read_field(run.block->terminateRequest) == 1) {
        run.keepRunning = 0;
    }
    if (run.src == 0 && run.keepRunning == 1) {
        run.slept = sleep_measured(*run.block);
    }
}

// Closes the control file and gives back what the control file's tables hold.
void end(monitor_run &run) {
    run.src = filesvc_close_file(run.handle, &run.crc);
    if (run.src != 0) {
        tracesvc_trace("TARNMNDF: Error on filesvc_close_file");
        run.src = tarn_mon_error_handler(run.src | REPORT_SRC, run.crc, RC_CONTROL_FILE_CLOSE);
    }
    tracesvc_trace("TARNMNDF: num_external_calls = %d", num_external_calls);
    release_control_file_tables(&run.crc);
}

} // namespace

long (*uptime_source)() = system_uptime;
void (*one_second_sleep)() = sleep_one_second;

TARN_EXPORT uint32_t tarn_mon_main(int32_t argc, char **argv) {
    monitor_run run;
    start(run, argc, argv);
    uint32_t info = 0;
    if (filesvc_search_file_open(CONTROL_FILE_NAME, OPEN_EXISTING, READ_ACCESS, CONTROL_FILE_SHARE,
                                 CONTROL_FILE_OPTIONS, &run.handle, &info, &run.crc) != 0) {
        // Without a control file the monitor does not run, and says so to nobody.
        run.src = 0;
        run.crc = 0;
        tracesvc_trace("TARNMNDF:    System Return Code: %d", run.src);
        return 0;
    }
    if (read_control_file(run)) {
        tracesvc_trace("TARNMNDF: Everything ok to run");
        run.src = tarn_init(&run.crc);
        run.block = TARN_CB_PTR.get();
        if (run.src == 0 && run.block != nullptr) {
            write_field(run.block->numLoopsBeforeCPUChecking, CPU_ALERTS_ON_COUNTDOWN);
            write_field(run.block->sleepTimeExceeded, 0);
            write_field(run.block->terminateRequest, 0);
            while (run.src == 0 && run.keepRunning == 1) {
                run_pass(run);
            }
        }
    }
    end(run);
    tracesvc_trace("TARNMNDF:    System Return Code: %d", run.src);
    return run.src;
}
