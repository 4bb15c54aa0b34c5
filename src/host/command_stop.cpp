// tarnmon stop: asks the running monitor to end after its current pass.
#include <cstdio>

#include "commands.h"
#include "control_block_view.h"

int command_stop(const command_line &) {
    // The request is logged as an event whether or not a monitor is there to see it.
    tarn_terminate_monitoring();
    control_block_view view = attach_control_block();
    if (view.block == nullptr) {
        std::fprintf(stderr, "tarnmon: %s; the request was logged only\n", view.problem.c_str());
        return EXIT_UNAVAILABLE;
    }
    bool requested = view.block->terminateRequest == 1;
    detach_control_block(view);
    if (!requested) {
        std::fprintf(stderr, "tarnmon: the terminate request did not reach the control block\n");
        return EXIT_UNAVAILABLE;
    }
    std::printf("termination requested: the monitor ends after its current pass\n");
    return EXIT_OK;
}
