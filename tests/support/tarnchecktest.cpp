// The module "tarnchecktest" (libtarnchecktest.so): external checking routines of the kind an
// appliance adds beside the monitor's samples, for the tests that have the loop resolve them
// through the module service. Each shows one answer the loop must handle: no text at all, a text
// longer than any room a pass has left, and an ordinary text built from the control file it is
// handed. Their texts live in static storage, since the loop never frees what it is given.
#include <cstdio>
#include <cstring>

#include "tracesvc.h"

namespace {

// Longer than the whole of the pass's data block, so longer than whatever room is left of it.
constexpr size_t FLOOD_LENGTH = 1545056;
constexpr char FLOOD_LINE[] = "tarn_check_flood has more to say than a pass can hold \n\r";
char flood[FLOOD_LENGTH + 1];

// The keyword of the control file that tarn_check_status looks for, and the text it builds.
constexpr char STATUS_KEYWORD[] = "\nTARNCHECKTEST_STATUS ";
char status_text[256];

// The word after STATUS_KEYWORD in the control file's text, or "unset" without such a line.
void status_word(const char *fileData, char *word, size_t size) {
    std::snprintf(word, size, "unset");
    const char *at = std::strstr(fileData, STATUS_KEYWORD);
    if (at != nullptr) {
        at += sizeof STATUS_KEYWORD - 1;
        size_t length = std::strcspn(at, " \t\r\n");
        std::snprintf(word, size, "%.*s", static_cast<int>(length), at);
    }
}

} // namespace

extern "C" {

__attribute__((visibility("default"))) void tarn_check_nothing(const char *fileData,
                                                               char **returnedData);
__attribute__((visibility("default"))) void tarn_check_flood(const char *fileData,
                                                             char **returnedData);
__attribute__((visibility("default"))) void tarn_check_status(const char *fileData,
                                                              char **returnedData);

// Has nothing to add: returnedData stays as the loop left it, null.
void tarn_check_nothing(const char *, char **) {
    tracesvc_trace("TARNCKTF: --> tarn_check_nothing");
    tracesvc_trace("TARNCKTF: <-- tarn_check_nothing");
}

void tarn_check_flood(const char *, char **returnedData) {
    tracesvc_trace("TARNCKTF: --> tarn_check_flood");
    if (flood[0] == '\0') {
        const size_t line_length = sizeof FLOOD_LINE - 1;
        for (size_t at = 0; at < FLOOD_LENGTH; at += line_length) {
            size_t part = FLOOD_LENGTH - at < line_length ? FLOOD_LENGTH - at : line_length;
            std::memcpy(flood + at, FLOOD_LINE, part);
        }
        flood[FLOOD_LENGTH] = '\0';
    }
    *returnedData = flood;
    tracesvc_trace("TARNCKTF: <-- tarn_check_flood");
}

void tarn_check_status(const char *fileData, char **returnedData) {
    tracesvc_trace("TARNCKTF: --> tarn_check_status");
    char word[64];
    status_word(fileData, word, sizeof word);
    std::snprintf(status_text, sizeof status_text,
                  "tarnchecktest status is %s \n\r Second line of tarnchecktest\n\r", word);
    *returnedData = status_text;
    tracesvc_trace("TARNCKTF: <-- tarn_check_status");
}

} // extern "C"
