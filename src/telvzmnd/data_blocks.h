// The large text buffers of a pass. They are static, reused every pass and owned by the monitoring
// thread; each holds text whose lines end in "\n\r".
#pragma once

#include <cstddef>
#include <cstdint>

inline constexpr size_t PRIMARY_DATA_BLOCK_SIZE = 1545056;
inline constexpr int32_t OUTBUFFER_BUDGET = 1500000; // outbufferleft at the start of a pass
inline constexpr size_t TOP_DATA_BLOCK_SIZE = 4096;
inline constexpr size_t LS_DATA_BLOCK_SIZE = 3045056;
inline constexpr size_t PS_DATA_BLOCK_SIZE = 250000;
inline constexpr size_t LINE_SIZE = 4096;
inline constexpr size_t WORD_COUNT = 50;
inline constexpr size_t WORD_SIZE = 250;
inline constexpr int32_t FILE_BUFFER_SIZE = 4591112;

extern char primaryDataBlock[PRIMARY_DATA_BLOCK_SIZE]; // everything a pass gathers, in order
extern int32_t outbufferleft; // bytes of primaryDataBlock still to be given out this pass
extern int32_t pdboverflow;   // 1 once this pass has written its overflow line
extern char topDataBlock[TOP_DATA_BLOCK_SIZE];    // error text of this pass's finding
extern char topLogDataBlock[TOP_DATA_BLOCK_SIZE]; // its copy, which heads the event attachment
extern char lsDataBlock[LS_DATA_BLOCK_SIZE];      // per-process descriptor listings
extern char newPSDataBlock[PS_DATA_BLOCK_SIZE];   // this pass's process listing
extern char oldPSDataBlock[PS_DATA_BLOCK_SIZE];   // the last pass's process listing
extern char line[LINE_SIZE];                      // scratch for composed lines
extern char words[WORD_COUNT][WORD_SIZE];         // scratch for split lines, one word a slot
extern char file_buffer[FILE_BUFFER_SIZE];        // snapshot text staged for the next flush

// Appending to primaryDataBlock. Every write of the block goes through these, its clear included:
// they keep the length of its text, so that an append costs what it adds, and how far it was
// written, so that a clear costs what was written. They never write past the block's end: what
// does not fit is dropped and the text stays terminated.

// The output-block rule of every check: the line and "\n\r" go in when the line's length + 5 is
// below outbufferleft, which then drops by length + 3; otherwise, once a pass (pdboverflow), the
// line "No room to output more lines... \n\r" goes in and outbufferleft becomes 4.
void append_data_line(const char *text);
// The same room test and overflow line, and the same cost of length + 3, for a line that goes in
// without its line end: a descriptor directory's header, which the count of its descriptors ends.
void append_data_line_unended(const char *text);
// A section header goes in (as far as the block holds it), and its length is added to outbufferleft
// (added: that has always been the rule for headers).
void append_header_line(const char *text);
// A command's section: a line end, then its header by the header rule.
void append_section_header(const char *header);
// Text that goes in without regard to outbufferleft.
void append_unbudgeted(const char *text);
// The length of the text in primaryDataBlock.
size_t primary_data_length();
// Empties primaryDataBlock, clearing only as far as anything was written since the last clear.
void clear_primary_data_block();

// What every pass starts with: primaryDataBlock, lsDataBlock and the two error texts empty (each
// cleared as far as it was written), the whole budget, and no overflow line yet.
void start_pass_data();

// Replaces the error text of this pass's finding: topDataBlock is cleared whole, as the check's own
// rewrite of it, and takes the formatted text, as much of it as the block holds.
void write_error_text(const char *format, ...) __attribute__((format(printf, 1, 2)));
// topLogDataBlock becomes a copy of all of topDataBlock, which heads the event's attachment.
void copy_error_text_to_log();
// Empties topDataBlock and topLogDataBlock. Like every clear of a block, these clear only as far
// as the blocks were written since their last clear, which leaves the bytes of a whole clear: the
// code that writes them is above and nowhere else.
void clear_error_texts();

// newPSDataBlock takes the text from `from` on, as much of it as the block holds; its last byte is
// always NUL, so a longer text keeps its first 249,999 bytes. Whatever it held before is cleared.
void copy_to_ps_data_block(const char *from);
// Empties newPSDataBlock, clearing only as far as anything was written since the last clear.
void clear_ps_data_block();

// lsDataBlock holds the listing of one descriptor directory at a time. A line goes in with its
// "\n\r" only when the whole of it fits before the block's terminating NUL; the first line that
// does not fit, and every line after it until the next clear, is dropped, so that a listing too
// long for the block keeps its beginning in whole lines.
void append_ls_line(const char *text);
// The length of the text in lsDataBlock.
size_t ls_data_length();
// Empties lsDataBlock, clearing only as far as anything was written since the last clear.
void clear_ls_data_block();
