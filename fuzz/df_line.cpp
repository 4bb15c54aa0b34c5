// The line handler of the file system check, fed any bytes as the whole output of both runs of
// df, cut into lines at each line feed as the runner hands them over. Whatever df prints, a line
// may only leave one of the check's own codes, a partition is listed exactly when it is reported,
// a held-back event is never reported, and no fixed buffer is written outside its bounds.
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <vector>

#include "core/reason_codes.h"
#include "core/settings.h"
#include "data_blocks.h"
#include "storage/file_listing.h"
#include "storage/file_system.h"

namespace {

int listings;
int cleanups;

void require(bool holds) {
    if (!holds) {
        __builtin_trap();
    }
}

bool terminated(const char *field, size_t size) {
    return std::memchr(field, '\0', size) != nullptr;
}

bool reported(uint32_t code) {
    return code == RC_OTHER_PARTITION_SPACE || code == RC_OTHER_PARTITION_INODES ||
           (code >= RC_PARTITION_SPACE_FIRST && code <= RC_PARTITION_SPACE_LAST) ||
           (code >= RC_PARTITION_INODES_FIRST && code <= RC_PARTITION_INODES_LAST);
}

template <typename Handler>
void for_each_line(const uint8_t *data, size_t size, Handler handler) {
    size_t start = 0;
    for (size_t i = 0; i <= size; ++i) {
        if (i == size ? i > start : data[i] == '\n') {
            std::vector<char> line(data + start, data + i);
            line.push_back('\0');
            handler(line.data());
            start = i + 1;
        }
    }
}

} // namespace

// Stand-ins for the runs through runAsRoot: the fuzzer must start no child.
uint32_t tarn_gather_file_list(const char *hddPartition, uint32_t *crc) {
    require(hddPartition != nullptr && terminated(hddPartition, WORD_SIZE));
    *crc = 0;
    ++listings;
    return 0;
}

uint32_t tarn_cleanup_partition(const char *hddPartition, uint32_t *crc) {
    require(hddPartition != nullptr && terminated(hddPartition, WORD_SIZE));
    *crc = 0;
    ++cleanups;
    return 0;
}

extern "C" int LLVMFuzzerInitialize(int *, char ***) {
    // Thresholds that lines can cross either way, a different one for each partition.
    int32_t threshold = 0;
    for (int32_t *each : {&dasd_percent_threshold,
                          &dasd_percent_slash_threshold,
                          &dasd_percent_slash_inode_threshold,
                          &dasd_percent_var_threshold,
                          &dasd_percent_var_inode_threshold,
                          &dasd_percent_tmp_threshold,
                          &dasd_percent_tmp_inode_threshold,
                          &dasd_percent_console_threshold,
                          &dasd_percent_console_inode_threshold,
                          &dasd_percent_ffdc_threshold,
                          &dasd_percent_ffdc_inode_threshold,
                          &dasd_percent_console_ffdc_threshold,
                          &dasd_percent_console_ffdc_inode_threshold,
                          &dasd_percent_dev_shm_threshold,
                          &dasd_percent_dev_shm_inode_threshold,
                          &dasd_percent_dump_threshold,
                          &dasd_percent_dump_inode_threshold,
                          &dasd_percent_extra_threshold,
                          &dasd_percent_extra_inode_threshold,
                          &dasd_percent_kzrdump_threshold,
                          &dasd_percent_kzrdump_inode_threshold,
                          &dasd_percent_mnt_upgrade_threshold,
                          &dasd_percent_mnt_upgrade_inode_threshold,
                          &dasd_percent_data_threshold,
                          &dasd_percent_data_inode_threshold,
                          &dasd_percent_var_wqn_log_threshold,
                          &dasd_percent_var_wqn_log_inode_threshold}) {
        *each = threshold;
        threshold += 37;
    }
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    for (df_pass kind : {df_pass::space, df_pass::inodes}) {
        for (uint32_t took_log : {0u, 1u}) {
            clear_primary_data_block();
            outbufferleft = OUTBUFFER_BUDGET;
            pdboverflow = 0;
            extraFileSystemSRCOn = static_cast<int32_t>(size & 1);
            int32_t take_log_crc = 0;
            int32_t take_log_value = -1;
            uint32_t crc = 0x1234;
            file_system_pass pass{&take_log_crc, &take_log_value, &took_log, &crc};
            for_each_line(data, size, [&](const char *line) {
                int32_t code_before = take_log_crc;
                int listed_before = listings;
                int cleaned_before = cleanups;
                df_line(pass, kind, line);
                auto code = static_cast<uint32_t>(take_log_crc);
                bool new_report = listings != listed_before;
                require(listings - listed_before <= 1 && cleanups - cleaned_before <= 1);
                require(cleanups == cleaned_before || new_report);
                if (took_log != 0) {
                    require(!new_report);
                    require(take_log_crc == code_before || code == TAKE_LOG_SUPPRESSED);
                } else if (take_log_crc != code_before) {
                    require(reported(code) || code == TAKE_LOG_SUPPRESSED);
                }
                if (kind == df_pass::inodes) {
                    require(extraFileSystemSRCOn == static_cast<int32_t>(size & 1));
                }
            });
            for (size_t i = 0; i < 7; ++i) {
                require(terminated(words[i], WORD_SIZE));
            }
            require(primaryDataBlock[PRIMARY_DATA_BLOCK_SIZE - 1] == '\0');
        }
    }
    return 0;
}
