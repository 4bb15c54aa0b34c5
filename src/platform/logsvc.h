/* Event log of the appliance. */
#pragma once
#include <stddef.h>
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

#define LOGSVC_RECORD_TYPE_EVENT 18
#define LOGSVC_REPORT_ERROR 0x300u
#define LOGSVC_REPORT_INFORMATIONAL 0x200u
/* Set in the option word when text is attached. */
#define LOGSVC_DATA_ATTACHED 0xC000u
#define LOGSVC_COMPONENT_LENGTH 12
#define LOGSVC_RECORD_SIZE 2112

/* The request handed to logsvc_microcode_log; every byte not named here is zero. */
typedef struct logsvc_record {
    uint8_t record_type;
    uint8_t reserved0[3];
    uint32_t option;
    char component[LOGSVC_COMPONENT_LENGTH];
    uint16_t reason_code;
    uint8_t reserved1[2];
    uint32_t comp_rc;
    uint8_t reserved2[4];
    char *attachment;
    uint32_t attachment_length;
    uint8_t reserved3[LOGSVC_RECORD_SIZE - 44];
} logsvc_record;

#ifdef __cplusplus
static_assert(offsetof(logsvc_record, record_type) == 0);
static_assert(offsetof(logsvc_record, option) == 4);
static_assert(offsetof(logsvc_record, component) == 8);
static_assert(offsetof(logsvc_record, reason_code) == 20);
static_assert(offsetof(logsvc_record, comp_rc) == 24);
static_assert(offsetof(logsvc_record, attachment) == 32);
static_assert(offsetof(logsvc_record, attachment_length) == 40);
static_assert(sizeof(logsvc_record) == LOGSVC_RECORD_SIZE);
#endif

/* record points at a logsvc_record. Out: *crc. 0 = logged. */
uint32_t logsvc_microcode_log(void *record, uint32_t *crc);

#ifdef __cplusplus
}
#endif
