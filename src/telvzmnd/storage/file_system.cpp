#include "storage/file_system.h"

#include <cstring>

#include "command_runner.h"
#include "core/check_contract.h"
#include "core/pass_figures.h"
#include "core/settings.h"
#include "core/words.h"
#include "data_blocks.h"
#include "storage/file_listing.h"
#include "tracesvc.h"

int32_t extraFileSystemSRCOn;

namespace {

// A mount point of the appliance with thresholds of its own. Its inode code is its space code plus
// INODE_CODE_OFFSET.
struct known_partition {
    const char *mount_point;
    const char *named_as; // in the messages: "/mnt/upgrade" has always been called "/mnt_upgrade"
    int32_t *space_threshold;
    int32_t *inode_threshold;
    uint32_t space_code;
};

constexpr uint32_t INODE_CODE_OFFSET = 0x10;

// Compared in this order, exactly and case-sensitively; the first match decides. The codes follow
// the partitions, not this order.
constexpr known_partition KNOWN_PARTITIONS[] = {
    {"/console/ffdc", "/console/ffdc", &dasd_percent_console_ffdc_threshold,
     &dasd_percent_console_ffdc_inode_threshold, 0xE131},
    {"/console", "/console", &dasd_percent_console_threshold, &dasd_percent_console_inode_threshold,
     0xE132},
    {"/ffdc", "/ffdc", &dasd_percent_ffdc_threshold, &dasd_percent_ffdc_inode_threshold, 0xE133},
    {"/var", "/var", &dasd_percent_var_threshold, &dasd_percent_var_inode_threshold, 0xE134},
    {"/tmp", "/tmp", &dasd_percent_tmp_threshold, &dasd_percent_tmp_inode_threshold, 0xE135},
    {"/dev/shm", "/dev/shm", &dasd_percent_dev_shm_threshold, &dasd_percent_dev_shm_inode_threshold,
     0xE137},
    {"/dump", "/dump", &dasd_percent_dump_threshold, &dasd_percent_dump_inode_threshold, 0xE138},
    {"/extra", "/extra", &dasd_percent_extra_threshold, &dasd_percent_extra_inode_threshold,
     RC_EXTRA_PARTITION_SPACE},
    {"/kzrdump", "/kzrdump", &dasd_percent_kzrdump_threshold, &dasd_percent_kzrdump_inode_threshold,
     0xE13A},
    {"/mnt/upgrade", "/mnt_upgrade", &dasd_percent_mnt_upgrade_threshold,
     &dasd_percent_mnt_upgrade_inode_threshold, 0xE13B},
    {"/", "/", &dasd_percent_slash_threshold, &dasd_percent_slash_inode_threshold, 0xE136},
    {"/data", "/data", &dasd_percent_data_threshold, &dasd_percent_data_inode_threshold, 0xE13C},
    {"/var/wqn/log", "/var/wqn/log", &dasd_percent_var_wqn_log_threshold,
     &dasd_percent_var_wqn_log_inode_threshold, 0xE13D},
};

// Every other mount point is "A DASD partition" to the messages.
constexpr const char *OTHER_PARTITION = "A DASD partition";
constexpr const char *SPACE_MESSAGE = "TARNMNDF: %s is too full";
constexpr const char *INODE_MESSAGE = "TARNMNDF: %s has too many files";

// Of the mount points in no row, these are never judged.
constexpr char REMOVABLE_MEDIA[] = "/media";
constexpr char LOOP_DEVICE[] = "/dev/loop";
constexpr char INSTALL_IMAGES[] = "/dump/wqn_install.images";
constexpr char HOME[] = "/home"; // the one other mount point whose files are listed when full
// Only these types are judged by space: every other type, df's heading line among them, is not.
constexpr const char *SPACE_JUDGED_TYPES[] = {"ext3", "ext4"};
constexpr size_t TYPE_PREFIX = 4;

constexpr int DEVICE_WORD = 0;
constexpr int TYPE_WORD = 1; // space pass only

constexpr const char *SPACE_ARGV[] = {"df", "-h", "-l", "-T", nullptr};
constexpr const char *INODE_ARGV[] = {"df", "--inodes", "-l", nullptr};

// How each run of df is started and how its lines are read.
struct df_layout {
    command_spec command;
    const char *header;
    int word_count;
    int use_word;
    int mount_word;
};

constexpr df_layout SPACE_LAYOUT = {
    {nullptr, SPACE_ARGV, "df", "df"}, "About to output df data \n\r", 7, 5, 6};
constexpr df_layout INODE_LAYOUT = {
    {nullptr, INODE_ARGV, "df1", "df1"}, "About to output df --inodes data \n\r", 6, 4, 5};

const df_layout &layout_of(df_pass kind) {
    return kind == df_pass::space ? SPACE_LAYOUT : INODE_LAYOUT;
}

bool begins_with(const char *text, const char *prefix) {
    return std::strncmp(text, prefix, std::strlen(prefix)) == 0;
}

// df's percentage of a partition, as opposed to its heading ("Use%") or the "-" of a file system
// without inodes.
bool is_percentage(const char *word) {
    size_t length = std::strlen(word);
    return length > 1 && word[0] >= '0' && word[0] <= '9' && word[length - 1] == '%';
}

const known_partition *known_partition_of(const char *mount_point) {
    for (const known_partition &row : KNOWN_PARTITIONS) {
        if (std::strcmp(mount_point, row.mount_point) == 0) {
            return &row;
        }
    }
    return nullptr;
}

// One over-threshold line as the line `text` of df, its use in tenths of a percent.
struct finding {
    const char *message;
    const char *named_as;
    uint32_t code;
    int32_t used;
    const char *text;
};

void report(const file_system_pass &pass, const finding &found) {
    tracesvc_trace(found.message, found.named_as);
    tracesvc_trace("TARNMNDF: percent_used = %d (dec)", found.used / 10);
    tracesvc_trace("TARNMNDF: Entire line was [%s]", found.text);
    *pass.takeLogCrc = static_cast<int32_t>(found.code);
    *pass.takeLogValue = found.used;
}

void list_files(const file_system_pass &pass, const char *mount_point) {
    tarn_gather_file_list(mount_point, pass.crc);
}

void list_and_clean_up(const file_system_pass &pass, const char *mount_point) {
    tarn_gather_file_list(mount_point, pass.crc);
    tarn_cleanup_partition(mount_point, pass.crc);
}

void judge_known(const file_system_pass &pass, df_pass kind, const known_partition &row,
                 int32_t used, const char *text) {
    bool space = kind == df_pass::space;
    if (used <= *(space ? row.space_threshold : row.inode_threshold) ||
        !finding_to_report(pass.takeLogCrc, pass.tookLog)) {
        return;
    }
    uint32_t code = space ? row.space_code : row.space_code + INODE_CODE_OFFSET;
    report(pass, {space ? SPACE_MESSAGE : INODE_MESSAGE, row.named_as, code, used, text});
    list_and_clean_up(pass, row.mount_point);
}

// A full /extra is reported once, as information, and then held back (without the 0x10000 mark,
// so that it never keeps the loop's tookLog latch set) until it has been at or below its
// threshold again.
void judge_extra_space(const file_system_pass &pass, const known_partition &row, int32_t used,
                       const char *text) {
    if (used <= *row.space_threshold) {
        tracesvc_trace("TARNMNDF: setting extraFileSystemSRCOn as false");
        extraFileSystemSRCOn = 0;
        return;
    }
    if (extraFileSystemSRCOn != 0 || read_field(*pass.tookLog) != 0) {
        return;
    }
    report(pass, {SPACE_MESSAGE, row.named_as, row.space_code, used, text});
    list_and_clean_up(pass, row.mount_point);
}

bool judged_by_space(const char *type) {
    for (const char *judged : SPACE_JUDGED_TYPES) {
        if (std::strncmp(type, judged, TYPE_PREFIX) == 0) {
            return true;
        }
    }
    return false;
}

// Why a mount point in no row is not judged in this pass, traced; false when it is judged.
bool ignored(df_pass kind, const char *mount_point) {
    const char *device = words[DEVICE_WORD];
    if (begins_with(mount_point, REMOVABLE_MEDIA)) {
        tracesvc_trace("TARNMNDF: found removeable media [%s], ignore", mount_point);
        return true;
    }
    bool skipped = kind == df_pass::space ? !judged_by_space(words[TYPE_WORD])
                                          : begins_with(device, LOOP_DEVICE) ||
                                                begins_with(mount_point, INSTALL_IMAGES);
    if (skipped) {
        tracesvc_trace("TARNMNDF: found loop device [%s], ignore", device);
    }
    return skipped;
}

void judge_other(const file_system_pass &pass, df_pass kind, const char *mount_point, int32_t used,
                 const char *text) {
    if (ignored(kind, mount_point) || used <= dasd_percent_threshold ||
        !finding_to_report(pass.takeLogCrc, pass.tookLog)) {
        return;
    }
    bool space = kind == df_pass::space;
    report(pass, {space ? SPACE_MESSAGE : INODE_MESSAGE, OTHER_PARTITION,
                  space ? RC_OTHER_PARTITION_SPACE : RC_OTHER_PARTITION_INODES, used, text});
    if (!space || std::strcmp(mount_point, HOME) == 0) {
        list_files(pass, mount_point);
    }
}

void run_df(const file_system_pass &pass, df_pass kind) {
    const df_layout &layout = layout_of(kind);
    append_section_header(layout.header);
    run_command(layout.command, [&pass, kind](char *text, size_t) { df_line(pass, kind, text); });
}

} // namespace

void df_line(const file_system_pass &pass, df_pass kind, const char *text) {
    const df_layout &layout = layout_of(kind);
    bool space = kind == df_pass::space;
    if (space) {
        // "ps data": the words of the per-process check, which df lines have always shared.
        tracesvc_trace("TARNMNDD: ps data: [%s]", text);
    }
    append_data_line(text);
    int found = split_words(text, layout.word_count);
    // df's whole percentage, read up to its "%", in tenths as the thresholds are.
    int32_t used = wrap32(int64_t{read_number(words[layout.use_word])} * 10);
    const char *mount_point = words[layout.mount_word];
    if (space) {
        tracesvc_trace("TARNMNDD: words[6] = [%s]", mount_point);
    }
    // Figures only of a line with a percentage and a mount point of its own; a short line keeps
    // the words of the line before it.
    if (found > layout.mount_word && is_percentage(words[layout.use_word])) {
        note_partition_use(space, mount_point, used);
    }
    const known_partition *row = known_partition_of(mount_point);
    if (row == nullptr) {
        judge_other(pass, kind, mount_point, used, text);
    } else if (space && row->space_code == RC_EXTRA_PARTITION_SPACE) {
        judge_extra_space(pass, *row, used, text);
    } else {
        judge_known(pass, kind, *row, used, text);
    }
}

TARN_EXPORT uint32_t tarn_check_file_system(int32_t *takeLogCrc, int32_t *takeLogValue,
                                            uint32_t *tookLog, uint32_t *crc) {
    tracesvc_trace("TARNOTHF: --> tarn_check_file_system");
    uint32_t src = 0;
    file_system_pass pass{takeLogCrc, takeLogValue, tookLog, crc};
    run_df(pass, df_pass::space);
    run_df(pass, df_pass::inodes);
    tracesvc_trace("TARNOTHF: <-- tarn_check_file_system, src = %x, compRc = %x (hex), "
                   "TakeLogCrc = %x(hex) ",
                   src, *crc, static_cast<uint32_t>(*takeLogCrc));
    return src;
}
