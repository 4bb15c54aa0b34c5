// The recording platform: every platform service the library calls, defined inside the test
// program. It keeps every trace line and every event with a copy of its attachment, serves data
// files from a temporary directory, and fails any chosen call with a chosen return code.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "jcb.h"
#include "logsvc.h"

namespace rec {

enum class Call {
    search_file_open,
    random_read,
    random_write,
    query_file_size,
    delete_file,
    close_file,
    microcode_log,
    get_func_addr2,
    release_func_addr,
    ckptr,
    malloc, // a failed allocation returns null; rc and crc are ignored
    calloc,
    get_boolean_argument, // the Java bridge's fetch fails with rc; crc is ignored
    count_
};

// Makes calls of `call` fail with `rc` and `*crc` = `crc`: the call after `skip` successful
// ones, and the `times` - 1 after it (times < 0: every call from then on).
void fail(Call call, uint32_t rc, uint32_t crc = 0, int skip = 0, int times = 1);
// How many times `call` was made since the last reset.
int calls(Call call);

struct Event {
    logsvc_record record; // as handed over; its attachment pointer is dangling afterwards
    std::string attachment;
    bool has_attachment;
};
struct Dump {
    std::string title;
    std::string bytes;
    size_t after_traces; // how many trace lines came before it
};

const std::vector<std::string> &traces();
const std::vector<Dump> &dumps();
const std::vector<Event> &events();
// Index of the first trace line equal to `line` at or after `from`, or -1.
int find_trace(std::string_view line, int from = 0);
bool has_trace(std::string_view line);
// Lines that begin with `prefix`, in order.
std::vector<std::string> traces_starting(std::string_view prefix);
void clear_traces();

// The directory behind the data-file service, new and empty after each reset.
const std::string &data_dir();
void write_data_file(const std::string &name, std::string_view contents);
std::string read_data_file(const std::string &name); // empty when missing
bool data_file_exists(const std::string &name);
int open_data_files();

// What the module service resolves: `module`/`function` to `address`.
void register_function(const std::string &module, const std::string &function, void *address);

// Blocks of the debugging allocator still live, as "file:line" each.
std::vector<std::string> live_allocations();

// The Java bridge. A call's context is java_context(); its one boolean argument is what
// set_boolean_argument gave (0 after each reset), and jcbGetLastErrorMessage gives the text of
// set_last_error_message (empty after each reset). What the library sets on a call is kept in
// order.
struct BridgeCall {
    enum class Kind { native_function_error, return_codes, void_result };
    Kind kind;
    const jcb_context *context;
    std::string text; // native_function_error: the formatted message
    uint32_t src = 0; // return_codes
    uint32_t crc = 0; // return_codes
};
jcb_context *java_context();
void set_boolean_argument(int value);
void set_last_error_message(const std::string &text);
const std::vector<BridgeCall> &bridge_calls();

// What tracesvc_getpid returns from now on: `pid`, or this process's own pid when 0 (as after each
// reset).
void set_pid(uint32_t pid);

// Back to a fresh platform: no traces, events, failures, registered functions, allocations,
// bridge calls remembered; a new empty data directory.
void reset();

} // namespace rec
