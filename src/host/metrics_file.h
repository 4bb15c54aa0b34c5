// The metrics file of tarnmon run --metrics: after every pass, the figures the checks computed and
// what the passes found, as Prometheus text exposition, for the text-file collector of a node
// exporter. The file is replaced whole, never written in place, so that a reader sees either the
// last pass's file or the one before, never a part of one.
#pragma once

#include <cstdint>
#include <map>
#include <string>
#include <string_view>
#include <utility>

#include "core/pass_figures.h"

// What the metrics count over the whole run.
struct metrics_totals {
    uint64_t passes = 0;
    uint64_t held_back = 0;
    std::map<int32_t, uint64_t> findings; // events raised, by reason code

    void count(const tarn_pass_figures &figures);
};

// The exposition of one pass's figures and the run's totals; `end_time`: when the pass ended, in
// seconds since the epoch.
std::string metrics_text(const tarn_pass_figures &figures, const metrics_totals &totals,
                         double end_time);

// Puts `text` in the place of the file `path` in one step: written whole into a new file beside it,
// which is then renamed over it. 0, or the errno of the step that failed; the new file is gone
// again then, and `path` untouched.
int replace_file(const std::string &path, std::string_view text);

// `path` as an absolute name, for a file that replace_file can write: its directory is there and
// takes a new file, and `path` is not a directory. 0, or the errno that says why not.
int settle_replaceable_file(const std::string &path, std::string *absolute_path);

// The observer of the monitor's passes that keeps the metrics file: its totals, and whether the
// last write failed, so that a failure that lasts is told once, and its end too.
class metrics_file {
  public:
    explicit metrics_file(std::string path) : path_(std::move(path)) {}

    // A tarn_pass_observer, with the metrics_file as its context.
    static void observe(const tarn_pass_figures *figures, void *self);

  private:
    void write(const tarn_pass_figures &figures);

    std::string path_;
    metrics_totals totals_;
    int failing_ = 0; // the errno of the last write that failed; 0 when it was written
};
