#include "recording_platform.h"

#include <array>
#include <atomic>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <map>
#include <mutex>
#include <sstream>
#include <unistd.h>

#include "data_files.h"
#include "filesvc.h"
#include "jcb.h"
#include "memsvc.h"
#include "modsvc.h"
#include "telvmemdebug.h"
#include "tracesvc.h"

namespace rec {
namespace {

struct Failure {
    uint32_t rc = 0;
    uint32_t crc = 0;
    int skip = 0;
    int times = 0; // 0 = none planned, < 0 = for ever
};

struct State {
    std::mutex lock;
    std::vector<std::string> traces;
    std::vector<Dump> dumps;
    std::vector<Event> events;
    std::array<Failure, static_cast<size_t>(Call::count_)> failures{};
    std::array<int, static_cast<size_t>(Call::count_)> counts{};
    std::map<std::pair<std::string, std::string>, void *> functions;
    std::map<void *, std::string> allocations;
    std::string directory;
    std::atomic<uint32_t> pid{0}; // 0 = the process's own
    std::vector<BridgeCall> bridge_calls;
    int boolean_argument = 0;
    std::string last_error_message;
};

// Never destroyed: the clean-up of the data directory at exit, and any trace of a static
// destructor, still find it.
State &state() {
    static State *s = new State;
    return *s;
}

// Counts the call and says whether it is to fail; on failure *crc is set.
bool planned_failure(Call call, uint32_t *rc, uint32_t *crc) {
    State &s = state();
    std::lock_guard guard(s.lock);
    auto index = static_cast<size_t>(call);
    s.counts[index]++;
    Failure &f = s.failures[index];
    if (f.times == 0) {
        return false;
    }
    if (f.skip > 0) {
        f.skip--;
        return false;
    }
    if (f.times > 0) {
        f.times--;
    }
    if (rc != nullptr) {
        *rc = f.rc;
    }
    if (crc != nullptr) {
        *crc = f.crc;
    }
    return true;
}

// The text of a printf-style format and its arguments.
std::string formatted(const char *format, va_list args) {
    va_list again;
    va_copy(again, args);
    int length = std::vsnprintf(nullptr, 0, format, args);
    std::string text(length > 0 ? static_cast<size_t>(length) : 0, '\0');
    std::vsnprintf(text.data(), text.size() + 1, format, again);
    va_end(again);
    return text;
}

void record_bridge_call(BridgeCall call) {
    State &s = state();
    std::lock_guard guard(s.lock);
    s.bridge_calls.push_back(std::move(call));
}

void make_directory() {
    State &s = state();
    char pattern[] = "/tmp/tarn-test-XXXXXX";
    const char *made = mkdtemp(pattern);
    if (made == nullptr) {
        std::perror("mkdtemp");
        std::abort();
    }
    s.directory = made;
}

struct Cleanup {
    ~Cleanup() {
        State &s = state();
        if (!s.directory.empty()) {
            std::error_code ignored;
            std::filesystem::remove_all(s.directory, ignored);
        }
    }
} cleanup;

} // namespace

void fail(Call call, uint32_t rc, uint32_t crc, int skip, int times) {
    State &s = state();
    std::lock_guard guard(s.lock);
    s.failures[static_cast<size_t>(call)] = Failure{rc, crc, skip, times};
}

int calls(Call call) {
    State &s = state();
    std::lock_guard guard(s.lock);
    return s.counts[static_cast<size_t>(call)];
}

const std::vector<std::string> &traces() {
    return state().traces;
}
const std::vector<Dump> &dumps() {
    return state().dumps;
}
const std::vector<Event> &events() {
    return state().events;
}

int find_trace(std::string_view line, int from) {
    const auto &lines = state().traces;
    for (size_t i = static_cast<size_t>(from); i < lines.size(); ++i) {
        if (lines[i] == line) {
            return static_cast<int>(i);
        }
    }
    return -1;
}

bool has_trace(std::string_view line) {
    return find_trace(line) >= 0;
}

std::vector<std::string> traces_starting(std::string_view prefix) {
    std::vector<std::string> found;
    for (const auto &line : state().traces) {
        if (line.starts_with(prefix)) {
            found.push_back(line);
        }
    }
    return found;
}

void clear_traces() {
    state().traces.clear();
    state().dumps.clear();
}

const std::string &data_dir() {
    if (state().directory.empty()) {
        make_directory();
    }
    return state().directory;
}

void write_data_file(const std::string &name, std::string_view contents) {
    std::ofstream out(data_dir() + "/" + name, std::ios::binary | std::ios::trunc);
    out.write(contents.data(), static_cast<std::streamsize>(contents.size()));
}

std::string read_data_file(const std::string &name) {
    std::ifstream in(data_dir() + "/" + name, std::ios::binary);
    std::ostringstream text;
    text << in.rdbuf();
    return text.str();
}

bool data_file_exists(const std::string &name) {
    return std::filesystem::exists(data_dir() + "/" + name);
}

int open_data_files() {
    return telv::data_files::open_count();
}

void register_function(const std::string &module, const std::string &function, void *address) {
    state().functions[{module, function}] = address;
}

std::vector<std::string> live_allocations() {
    std::vector<std::string> live;
    for (const auto &[block, where] : state().allocations) {
        live.push_back(where);
    }
    return live;
}

jcb_context *java_context() {
    // Only its address counts: the bridge of the tests keeps nothing in a context.
    static char context;
    return reinterpret_cast<jcb_context *>(&context);
}

void set_boolean_argument(int value) {
    State &s = state();
    std::lock_guard guard(s.lock);
    s.boolean_argument = value;
}

void set_last_error_message(const std::string &text) {
    State &s = state();
    std::lock_guard guard(s.lock);
    s.last_error_message = text;
}

const std::vector<BridgeCall> &bridge_calls() {
    return state().bridge_calls;
}

void set_pid(uint32_t pid) {
    state().pid = pid;
}

void reset() {
    State &s = state();
    s.pid = 0;
    {
        std::lock_guard guard(s.lock);
        s.traces.clear();
        s.dumps.clear();
        s.events.clear();
        s.failures.fill(Failure{});
        s.counts.fill(0);
        s.functions.clear();
        s.allocations.clear();
        s.bridge_calls.clear();
        s.boolean_argument = 0;
        s.last_error_message.clear();
    }
    if (!s.directory.empty()) {
        std::error_code ignored;
        std::filesystem::remove_all(s.directory, ignored);
    }
    make_directory();
}

} // namespace rec

using rec::BridgeCall;
using rec::Call;
using rec::planned_failure;

extern "C" {

uint32_t filesvc_search_file_open(const char *name, uint32_t open_mode, uint32_t access, uint32_t,
                                  uint32_t, filesvc_handle_t *handle, uint32_t *info,
                                  uint32_t *crc) {
    uint32_t rc;
    if (info != nullptr) {
        *info = 0;
    }
    if (planned_failure(Call::search_file_open, &rc, crc)) {
        return rc;
    }
    return telv::data_files::open(rec::data_dir(), name, open_mode, access, handle, crc);
}

uint32_t filesvc_random_read(filesvc_handle_t handle, void *buffer, uint32_t length, uint32_t mode,
                             uint32_t offset, uint32_t *bytes_read, uint32_t *info, uint32_t *crc) {
    uint32_t rc;
    if (info != nullptr) {
        *info = 0;
    }
    if (planned_failure(Call::random_read, &rc, crc)) {
        if (bytes_read != nullptr) {
            *bytes_read = 0;
        }
        return rc;
    }
    return telv::data_files::read(handle, buffer, length, mode, offset, bytes_read, crc);
}

uint32_t filesvc_random_write(filesvc_handle_t handle, const void *buffer, uint32_t length,
                              uint32_t mode, uint32_t offset, uint32_t *bytes_written,
                              uint32_t *info, uint32_t *crc) {
    uint32_t rc;
    if (info != nullptr) {
        *info = 0;
    }
    if (planned_failure(Call::random_write, &rc, crc)) {
        if (bytes_written != nullptr) {
            *bytes_written = 0;
        }
        return rc;
    }
    return telv::data_files::write(handle, buffer, length, mode, offset, bytes_written, crc);
}

uint32_t filesvc_query_file_size(const char *name, uint32_t *size, uint32_t *crc) {
    uint32_t rc;
    if (planned_failure(Call::query_file_size, &rc, crc)) {
        return rc;
    }
    return telv::data_files::query_size(rec::data_dir(), name, size, crc);
}

uint32_t filesvc_delete_file(const char *name, uint32_t *crc) {
    uint32_t rc;
    if (planned_failure(Call::delete_file, &rc, crc)) {
        return rc;
    }
    return telv::data_files::remove(rec::data_dir(), name, crc);
}

uint32_t filesvc_close_file(filesvc_handle_t handle, uint32_t *crc) {
    uint32_t rc;
    if (planned_failure(Call::close_file, &rc, crc)) {
        // The planned failure still releases the handle, so that tests do not leak descriptors.
        uint32_t ignored;
        telv::data_files::close(handle, &ignored);
        return rc;
    }
    return telv::data_files::close(handle, crc);
}

int tracesvc_trace(const char *format, ...) {
    va_list args;
    va_start(args, format);
    std::string line = rec::formatted(format, args);
    va_end(args);
    auto length = static_cast<int>(line.size());
    if (std::getenv("REC_TRACE_ECHO") != nullptr) {
        std::fprintf(stderr, "%s\n", line.c_str());
    }
    rec::State &s = rec::state();
    std::lock_guard guard(s.lock);
    s.traces.push_back(std::move(line));
    return length;
}

int tracesvc_dump_bytes(const char *title, const void *data, uint32_t length) {
    rec::State &s = rec::state();
    std::lock_guard guard(s.lock);
    s.dumps.push_back(
        rec::Dump{title != nullptr ? title : "",
                  std::string(static_cast<const char *>(data), data != nullptr ? length : 0),
                  s.traces.size()});
    return 0;
}

uint32_t tracesvc_getpid(void) {
    uint32_t pid = rec::state().pid;
    return pid != 0 ? pid : static_cast<uint32_t>(getpid());
}

uint32_t logsvc_microcode_log(void *record, uint32_t *crc) {
    uint32_t rc;
    bool failing = planned_failure(Call::microcode_log, &rc, crc);
    rec::Event event{};
    std::memcpy(&event.record, record, sizeof(logsvc_record));
    event.has_attachment = event.record.attachment != nullptr;
    if (event.has_attachment) {
        event.attachment.assign(event.record.attachment, event.record.attachment_length);
    }
    rec::State &s = rec::state();
    std::lock_guard guard(s.lock);
    s.events.push_back(std::move(event));
    return failing ? rc : 0;
}

int jcbGetBooleanArgument(jcb_context *, int *value) {
    uint32_t rc;
    if (planned_failure(Call::get_boolean_argument, &rc, nullptr)) {
        return static_cast<int>(rc);
    }
    rec::State &s = rec::state();
    std::lock_guard guard(s.lock);
    *value = s.boolean_argument;
    return 0;
}

const char *jcbGetLastErrorMessage(void) {
    return rec::state().last_error_message.c_str();
}

void jcbSetNativeFunctionError(jcb_context *ctx, const char *format, ...) {
    va_list args;
    va_start(args, format);
    std::string text = rec::formatted(format, args);
    va_end(args);
    rec::record_bridge_call({BridgeCall::Kind::native_function_error, ctx, std::move(text)});
}

void jcbSetReturnCodes(jcb_context *ctx, uint32_t src, uint32_t crc) {
    rec::record_bridge_call({BridgeCall::Kind::return_codes, ctx, "", src, crc});
}

void jcbSetVoidResult(jcb_context *ctx) {
    rec::record_bridge_call({BridgeCall::Kind::void_result, ctx, ""});
}

uint32_t modsvc_get_func_addr2(const char *module, const char *function, void **address,
                               void **handle, uint32_t *crc) {
    uint32_t rc;
    if (planned_failure(Call::get_func_addr2, &rc, crc)) {
        return rc;
    }
    rec::State &s = rec::state();
    auto found =
        s.functions.find({module != nullptr ? module : "", function != nullptr ? function : ""});
    if (found == s.functions.end()) {
        if (crc != nullptr) {
            *crc = 2; // ENOENT: no such routine
        }
        return 8;
    }
    *address = found->second;
    *handle = found->second;
    if (crc != nullptr) {
        *crc = 0;
    }
    return 0;
}

uint32_t modsvc_release_func_addr(const char *, void *, uint32_t *crc) {
    uint32_t rc;
    if (planned_failure(Call::release_func_addr, &rc, crc)) {
        return rc;
    }
    if (crc != nullptr) {
        *crc = 0;
    }
    return 0;
}

uint32_t memsvc_ckptr(const void *ptr, uint32_t) {
    uint32_t rc;
    if (planned_failure(Call::ckptr, &rc, nullptr)) {
        return rc;
    }
    return ptr == nullptr ? 1u : 0u;
}

static void remember(void *block, const char *file, int line) {
    if (block == nullptr) {
        return;
    }
    rec::State &s = rec::state();
    std::lock_guard guard(s.lock);
    s.allocations[block] = std::string(file != nullptr ? file : "?") + ":" + std::to_string(line);
}

void *telvmemdebug_malloc(size_t size, const char *file, int line) {
    if (planned_failure(Call::malloc, nullptr, nullptr)) {
        return nullptr;
    }
    void *block = std::malloc(size);
    remember(block, file, line);
    return block;
}

void *telvmemdebug_calloc(size_t count, size_t size, const char *file, int line) {
    if (planned_failure(Call::calloc, nullptr, nullptr)) {
        return nullptr;
    }
    void *block = std::calloc(count, size);
    remember(block, file, line);
    return block;
}

void telvmemdebug_free(void *ptr, const char *, int) {
    if (ptr == nullptr) {
        return;
    }
    {
        rec::State &s = rec::state();
        std::lock_guard guard(s.lock);
        s.allocations.erase(ptr);
    }
    std::free(ptr);
}

} // extern "C"
