// What leaves libtelvplatform.so: the C services of the platform boundary and nothing else. The
// implementation behind them is hidden in the platform's core.
#pragma once

#define TELV_PLATFORM_EXPORT extern "C" __attribute__((visibility("default")))
