// The parser of /proc/<pid>/limits and the ranking of processes, fed any bytes: the bytes as a
// limits file, and as the keyword text of a control file; then the soft limit found ranks
// processes into a list that never grows past its capacity and stays in order.
#include <cstddef>
#include <cstdint>
#include <string>

#include "descriptors.h"
#include "support/extra_fuzz.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    std::string_view input(reinterpret_cast<const char *>(data), size);
    open_files_limit limit = parse_open_files_limit(input);
    extra_fuzz::require(limit.kind == open_files_limit::value || limit.soft == 0);
    std::string control(input);
    int64_t listed = keyword_number(control.c_str(), LISTED_KEYWORD, LISTED_DEFAULT, 1, LISTED_MAX);
    extra_fuzz::require(listed >= 1 && listed <= LISTED_MAX);

    descriptor_share processes[LISTED_MAX + 1];
    processes[LISTED_MAX].pid = 0x5a5a; // a guard past the list's capacity
    size_t count = 0;
    for (size_t i = 0; i < size; ++i) {
        descriptor_share process{};
        process.pid = i;
        process.basis_points = (limit.soft + data[i]) % 1000;
        count = rank_process(processes, count, static_cast<size_t>(listed), process);
        extra_fuzz::require(count <= static_cast<size_t>(listed) && count <= i + 1);
    }
    for (size_t i = 1; i < count; ++i) {
        extra_fuzz::require(processes[i - 1].basis_points >= processes[i].basis_points);
    }
    extra_fuzz::require(processes[LISTED_MAX].pid == 0x5a5a);
    return 0;
}
