#include "storage/open_files.h"

#include <algorithm>
#include <cstdio>
#include <cstring>

#include "command_runner.h"
#include "core/check_contract.h"
#include "core/pass_figures.h"
#include "core/settings.h"
#include "core/words.h"
#include "data_blocks.h"
#include "tracesvc.h"

namespace {

constexpr const char *FILE_NR_ARGV[] = {"cat", "/proc/sys/fs/file-nr", nullptr};
constexpr const char *LISTING_ARGV[] = {"runAsRoot", "lsmon.sh", nullptr};
constexpr command_spec FILE_NR_COMMAND = {nullptr, FILE_NR_ARGV, "cat", "cat"};
// The script has always been traced under the name of the ls it runs.
constexpr command_spec LISTING_COMMAND = {nullptr,
                                          LISTING_ARGV,
                                          "ls",
                                          "ls",
                                          "TARNMNDF:    about to call ls command",
                                          "TARNMNDD:    about to process ls command results"};

constexpr int FILE_NR_WORDS = 3; // allocated, free allocated, maximum
constexpr int LISTING_WORDS = 2;
constexpr char DIRECTORY_PREFIX[] = "/proc"; // "/proc/<pid>/fd:" begins a directory's block
// A block's summary number is its line count less five, and only a block of more than four lines
// has one, whatever the script prints around the descriptors.
constexpr int32_t SUMMARY_LINES_LEFT_OUT = 5;

int32_t clamped32(int64_t value) {
    return static_cast<int32_t>(std::clamp<int64_t>(value, INT32_MIN, INT32_MAX));
}

// A number of file-nr in tenths, as the shares are: a maximum beyond the 32-bit range (a host
// without a limit prints 9223372036854775807) stays the largest, so its share is about 0.
int32_t tenfold(const char *word) {
    return clamped32(int64_t{read_number(word)} * 10);
}

// The summary number completes the output line that the block's header began.
void append_block_summary(int32_t block_lines) {
    if (block_lines < SUMMARY_LINES_LEFT_OUT) {
        return;
    }
    char summary[16];
    std::snprintf(summary, sizeof summary, " %d", block_lines - SUMMARY_LINES_LEFT_OUT);
    append_data_line(summary);
}

// Only the first block over the threshold in a pass counts, and only while no finding of this or
// an earlier check stands: the listing never overrides another reason code.
bool block_to_report(const open_files_listing &listing) {
    return listing.block_lines > pp_file_descriptors_threshold && *listing.pass.takeLogCrc == 0 &&
           finding_to_report(listing.pass.takeLogCrc, listing.pass.tookLog);
}

// The reported process's listing goes with the problem data when the whole of it fits in what
// the block has left, whatever outbufferleft says.
void attach_listing() {
    if (ls_data_length() < PRIMARY_DATA_BLOCK_SIZE - primary_data_length()) {
        append_unbudgeted(lsDataBlock);
    }
}

// The finding of a block: its count is the value, and its listing goes with the problem data.
void report_block(const open_files_listing &listing, const char *first_trace,
                  const char *quoted_line) {
    tracesvc_trace("%s", first_trace);
    tracesvc_trace("TARNMNDF: pp number is %d (dec)", listing.block_lines);
    tracesvc_trace("TARNMNDF: Entire line was [%s]", quoted_line);
    *listing.pass.takeLogCrc = RC_PROCESS_DESCRIPTORS;
    *listing.pass.takeLogValue = listing.block_lines;
    attach_listing();
}

void close_block(open_files_listing &listing, const char *header) {
    tracesvc_trace("TARNMNDD: total per-process file descriptors = %d (dec)", listing.block_lines);
    if (block_to_report(listing)) {
        // The line quoted is the header that closed the block: the next directory's, not the
        // reported one's, which lsDataBlock still holds.
        report_block(listing, "TARNMNDF: too many open files in process", header);
        write_error_text("\n\rError Information: \n\rtoo many open files in process\n\r"
                         "Entire line was: \n\r%s\n\r",
                         header);
    }
    append_block_summary(listing.block_lines);
    listing.block_lines = 0;
    clear_ls_data_block();
}

void check_file_nr(const open_files_pass &pass) {
    append_section_header("About to output cat /proc/sys/fs/file-nr data: \n\r");
    run_command(FILE_NR_COMMAND, [&pass](char *text, size_t) { file_nr_line(pass, text); });
}

void check_listing(const open_files_pass &pass) {
    append_section_header("About to output ls data: \n\r");
    open_files_listing listing{pass, 0, {}};
    if (run_command(LISTING_COMMAND, [&listing](char *text, size_t) {
            listing_line(listing, text);
        }) == command_outcome::pipe_failed) {
        return;
    }
    listing_end(listing);
}

} // namespace

std::optional<int32_t> share_in_use(const file_nr_figures &figures) {
    if (figures.maximum == 0) {
        return std::nullopt;
    }
    int64_t share = (int64_t{figures.allocated} - figures.free) * 1000 / figures.maximum;
    return clamped32(share);
}

void file_nr_line(const open_files_pass &pass, const char *text) {
    append_data_line(text);
    split_words(text, FILE_NR_WORDS);
    const file_nr_figures figures{tenfold(words[0]), tenfold(words[1]), tenfold(words[2])};
    tracesvc_trace("TARNMNDD: total allocated file descriptors = %d (dec)", figures.allocated);
    tracesvc_trace("TARNMNDD: total free allocated file descriptors = %d (dec)", figures.free);
    tracesvc_trace("TARNMNDD: maximum open file descriptors = %d (dec)", figures.maximum);
    std::optional<int32_t> share = share_in_use(figures);
    if (!share) {
        tracesvc_trace("TARNMNDF: maximum open file descriptors is 0, no share computed");
        return;
    }
    note_descriptor_share(*share);
    if (*share <= file_descriptors_percent_threshold ||
        !finding_to_report(pass.takeLogCrc, pass.tookLog)) {
        return;
    }
    tracesvc_trace("TARNMNDF: too many open files");
    // Quotient and remainder both truncate: -25 is traced as -2.-5.
    tracesvc_trace("TARNMNDF: percent_used = %d.%d (dec)", *share / 10, *share % 10);
    tracesvc_trace("TARNMNDF: Entire line was [%s]", text);
    *pass.takeLogCrc = RC_SYSTEM_DESCRIPTORS;
    *pass.takeLogValue = *share;
}

void listing_line(open_files_listing &listing, const char *text) {
    tracesvc_trace("TARNMNDD: ls -Rl /proc/*/fd: [%s]", text);
    listing.block_lines = wrap32(int64_t{listing.block_lines} + 1);
    listing.last_line.assign(text);
    // A line without words leaves the words of the line before: a blank line right after a
    // header is taken for a header again.
    split_words(text, LISTING_WORDS);
    if (std::strncmp(words[0], DIRECTORY_PREFIX, sizeof DIRECTORY_PREFIX - 1) == 0) {
        close_block(listing, text);
        append_data_line_unended(text);
    }
    append_ls_line(text);
}

void listing_end(open_files_listing &listing) {
    append_block_summary(listing.block_lines);
    if (block_to_report(listing)) {
        // No header closed this block: the line quoted is the last one read, and the error text
        // of the pass stays as it was.
        report_block(listing, "TARNMNDF: too many open files in process 2",
                     listing.last_line.c_str());
    }
}

TARN_EXPORT uint32_t tarn_check_open_files(int32_t *takeLogCrc, int32_t *takeLogValue,
                                           uint32_t *tookLog, uint32_t *crc) {
    tracesvc_trace("TARNOTHF: --> tarn_check_open_files");
    uint32_t src = 0;
    const open_files_pass pass{takeLogCrc, takeLogValue, tookLog};
    check_file_nr(pass);
    check_listing(pass);
    tracesvc_trace("TARNOTHF: <-- tarn_check_open_files, src = %x, crc = %x (hex)", src, *crc);
    return src;
}
