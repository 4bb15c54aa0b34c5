// A process that ends with two blocks of the debugging allocator still live and one given back,
// for the leak report at exit to name.
#include "telvmemdebug.h"

int main() {
    void *kept = telvmemdebug_malloc(24, "leaker.cpp", 11);
    void *given_back = telvmemdebug_calloc(3, 8, "leaker.cpp", 12);
    telvmemdebug_free(given_back, "leaker.cpp", 13);
    void *also_kept = telvmemdebug_malloc(100, "another.cpp", 7);
    return kept != nullptr && also_kept != nullptr ? 0 : 1;
}
