// What leaves the library: the library is built with hidden visibility, and only the entry points
// marked here are exported, with C linkage so that the host and other processes find them by name.
#pragma once

#define TARN_EXPORT extern "C" __attribute__((visibility("default")))
