// A child of the test with no descriptor to spare, for the failures that only a full descriptor
// table gives for real.
#pragma once

#include <functional>
#include <string>

namespace fake {

// Runs `body` in a forked child of the test whose every descriptor is taken (RLIMIT_NOFILE lowered
// and filled up), so that a pipe fails with EMFILE for real; returns the text `body` returned.
// The child's recording platform starts with no trace lines.
std::string run_without_descriptors(const std::function<std::string()> &body);

} // namespace fake
