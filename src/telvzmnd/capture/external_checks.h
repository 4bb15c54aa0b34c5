// The sample external checking routines: each hands back a fixed text, so that a control file
// line can exercise the mechanism of external routines end to end.
#pragma once

#include "export.h"

inline constexpr int SAMPLE_MESSAGE_SIZE = 54; // with the NUL

// The texts the samples hand back; writable, as any routine's own storage may be.
extern char message1[SAMPLE_MESSAGE_SIZE];
extern char message2[SAMPLE_MESSAGE_SIZE];
extern char message3[SAMPLE_MESSAGE_SIZE];

// Each traces the control file text it is given and sets *returnedData to its message.
TARN_EXPORT void tarn_external_check1(const char *fileData, char **returnedData);
TARN_EXPORT void tarn_external_check2(const char *fileData, char **returnedData);
TARN_EXPORT void tarn_external_check3(const char *fileData, char **returnedData);
