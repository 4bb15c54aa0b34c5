// A strict reader of Prometheus text exposition (format 0.0.4) for the tests of tarnmon's metrics
// file: every rule a scraper holds the file to is checked, and the first broken one is named with
// its line, so that a file the tests accept is one a text-file collector accepts.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace prometheus {

using labels = std::map<std::string, std::string>;

struct sample {
    std::string name;
    labels label_values; // unescaped
    double value;
};

struct family {
    std::string name;
    std::string type; // "untyped" when the file gives no TYPE line
    std::string help; // unescaped; empty without a HELP line
};

struct document {
    std::vector<family> families; // in the order of the file
    std::vector<sample> samples;

    // The value of the sample of `name` with exactly `with` as its labels.
    std::optional<double> value(std::string_view name, const labels &with = {}) const;
    // The samples of `name`, in the order of the file.
    std::vector<sample> samples_of(std::string_view name) const;
    const family *family_of(std::string_view name) const;
};

struct reading {
    document doc;
    std::string error; // empty when the text is valid; else "line N: what is wrong", or what
                       // is wrong with the whole text
};

reading parse(std::string_view text);

} // namespace prometheus
