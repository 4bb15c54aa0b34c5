#include "capture/external_checks.h"

#include <type_traits>

#include "core/control_file.h"
#include "tracesvc.h"

char message1[SAMPLE_MESSAGE_SIZE] = "Message 1 returned data \n\r Second line of Message 1\n\r";
char message2[SAMPLE_MESSAGE_SIZE] = "Message 2 returned data \n\r Second line of Message 2\n\r";
char message3[SAMPLE_MESSAGE_SIZE] = "Message 3 returned data \n\r Second line of Message 3\n\r";

namespace {

// The trace texts of one sample; they differ only in its number.
struct sample_traces {
    const char *entry;
    const char *message;
    const char *exit;
};

void run_sample(const sample_traces &traces, char *message, const char *fileData,
                char **returnedData) {
    tracesvc_trace("%s", traces.entry);
    tracesvc_trace("TARNOTHF: fileData pointer = %p", static_cast<const void *>(fileData));
    tracesvc_trace("TARNOTHF: returnedData pointer = %p", static_cast<void *>(returnedData));
    tracesvc_trace("TARNOTHF: start of fileData is: = [%s]", fileData);
    tracesvc_trace(traces.message, message);
    *returnedData = message;
    tracesvc_trace("%s", traces.exit);
}

} // namespace

static_assert(sizeof "Message 1 returned data \n\r Second line of Message 1\n\r" ==
              SAMPLE_MESSAGE_SIZE);

// The samples have the form the loop calls.
static_assert(std::is_same_v<decltype(&tarn_external_check1), external_check_routine>);

TARN_EXPORT void tarn_external_check1(const char *fileData, char **returnedData) {
    run_sample({"TARNOTHF: --> tarn_external_check1", "TARNOTHF: message1 is: = [%s]",
                "TARNOTHF: <-- tarn_external_check1"},
               message1, fileData, returnedData);
}

TARN_EXPORT void tarn_external_check2(const char *fileData, char **returnedData) {
    run_sample({"TARNOTHF: --> tarn_external_check2", "TARNOTHF: message2 is: = [%s]",
                "TARNOTHF: <-- tarn_external_check2"},
               message2, fileData, returnedData);
}

TARN_EXPORT void tarn_external_check3(const char *fileData, char **returnedData) {
    run_sample({"TARNOTHF: --> tarn_external_check3", "TARNOTHF: message3 is: = [%s]",
                "TARNOTHF: <-- tarn_external_check3"},
               message3, fileData, returnedData);
}
