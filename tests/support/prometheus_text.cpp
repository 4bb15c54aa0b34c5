#include "prometheus_text.h"

#include <cerrno>
#include <clocale>
#include <cmath>
#include <cstdlib>
#include <set>
#include <utility>

namespace prometheus {

namespace {

constexpr std::string_view TYPES[] = {"counter", "gauge", "histogram", "summary", "untyped"};

struct failure {
    std::string what;
};

bool is_letter(char c) {
    return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || c == '_';
}
bool is_digit(char c) {
    return c >= '0' && c <= '9';
}

bool is_metric_name(std::string_view name) {
    if (name.empty() || !(is_letter(name[0]) || name[0] == ':')) {
        return false;
    }
    for (char c : name) {
        if (!(is_letter(c) || is_digit(c) || c == ':')) {
            return false;
        }
    }
    return true;
}

bool is_label_name(std::string_view name) {
    if (name.empty() || !is_letter(name[0]) || name.starts_with("__")) {
        return false;
    }
    for (char c : name) {
        if (!(is_letter(c) || is_digit(c))) {
            return false;
        }
    }
    return true;
}

// Whether `text` is UTF-8 as the standard defines it: shortest forms, no surrogates, at most
// U+10FFFF.
bool is_utf8(std::string_view text) {
    size_t i = 0;
    while (i < text.size()) {
        auto c = static_cast<unsigned char>(text[i]);
        int more = c < 0x80           ? 0
                   : (c >> 5) == 0x6  ? 1
                   : (c >> 4) == 0xe  ? 2
                   : (c >> 3) == 0x1e ? 3
                                      : -1;
        if (more < 0 || text.size() - i <= static_cast<size_t>(more)) {
            return false;
        }
        uint32_t code = more == 0 ? c : c & (0x3f >> more);
        for (int k = 1; k <= more; ++k) {
            auto next = static_cast<unsigned char>(text[i + static_cast<size_t>(k)]);
            if ((next & 0xc0) != 0x80) {
                return false;
            }
            code = (code << 6) | (next & 0x3f);
        }
        static constexpr uint32_t SMALLEST[] = {0, 0x80, 0x800, 0x10000};
        if (code < SMALLEST[more] || code > 0x10ffff || (code >= 0xd800 && code <= 0xdfff)) {
            return false;
        }
        i += static_cast<size_t>(more) + 1;
    }
    return true;
}

double parse_value(std::string_view text) {
    if (text == "NaN") {
        return std::nan("");
    }
    if (text == "+Inf" || text == "Inf") {
        return INFINITY;
    }
    if (text == "-Inf") {
        return -INFINITY;
    }
    std::string copy(text);
    bool plain = !copy.empty();
    for (char c : copy) {
        plain = plain && (is_digit(c) || c == '.' || c == 'e' || c == 'E' || c == '+' || c == '-');
    }
    if (!plain) {
        throw failure{"value '" + copy + "' is not a number"};
    }
    char *end = nullptr;
    errno = 0;
    double value = std::strtod(copy.c_str(), &end);
    if (end != copy.c_str() + copy.size() || errno == ERANGE) {
        throw failure{"value '" + copy + "' is not a number"};
    }
    return value;
}

// The reader of one sample line.
class sample_line {
  public:
    explicit sample_line(std::string_view text) : text_(text) {}

    sample read() {
        sample s;
        s.name =
            std::string(take_while([](char c) { return is_letter(c) || is_digit(c) || c == ':'; }));
        if (!is_metric_name(s.name)) {
            throw failure{"no metric name"};
        }
        if (peek() == '{') {
            ++at_;
            read_labels(s.label_values);
        }
        if (blanks() == 0) {
            throw failure{"no blank before the value"};
        }
        std::string_view value = take_while([](char c) { return c != ' ' && c != '\t'; });
        s.value = parse_value(value);
        if (blanks() > 0 && at_ < text_.size()) {
            std::string_view stamp = take_while([](char c) { return c != ' ' && c != '\t'; });
            bool digits = !stamp.empty();
            for (size_t k = 0; k < stamp.size(); ++k) {
                digits = digits && (is_digit(stamp[k]) || (k == 0 && stamp[k] == '-'));
            }
            if (!digits) {
                throw failure{"timestamp '" + std::string(stamp) + "' is not an integer"};
            }
            blanks();
        }
        if (at_ != text_.size()) {
            throw failure{"text after the sample"};
        }
        return s;
    }

  private:
    char peek() const { return at_ < text_.size() ? text_[at_] : '\0'; }

    template <typename Keep>
    std::string_view take_while(Keep keep) {
        size_t start = at_;
        while (at_ < text_.size() && keep(text_[at_])) {
            ++at_;
        }
        return text_.substr(start, at_ - start);
    }

    size_t blanks() {
        return take_while([](char c) { return c == ' ' || c == '\t'; }).size();
    }

    void read_labels(labels &into) {
        for (;;) {
            blanks();
            if (peek() == '}') {
                ++at_;
                return;
            }
            std::string name(take_while([](char c) { return is_letter(c) || is_digit(c); }));
            if (!is_label_name(name)) {
                throw failure{"bad label name '" + name + "'"};
            }
            blanks();
            if (peek() != '=') {
                throw failure{"no '=' after label " + name};
            }
            ++at_;
            blanks();
            if (peek() != '"') {
                throw failure{"label " + name + " has no quoted value"};
            }
            ++at_;
            std::string value = read_label_value();
            if (!into.emplace(name, value).second) {
                throw failure{"label " + name + " twice"};
            }
            blanks();
            if (peek() == ',') {
                ++at_;
            } else if (peek() != '}') {
                throw failure{"no ',' or '}' after label " + name};
            }
        }
    }

    std::string read_label_value() {
        std::string value;
        for (;;) {
            if (at_ >= text_.size()) {
                throw failure{"label value not closed"};
            }
            char c = text_[at_++];
            if (c == '"') {
                return value;
            }
            if (c != '\\') {
                value += c;
                continue;
            }
            char escaped = peek();
            ++at_;
            if (escaped == '\\' || escaped == '"') {
                value += escaped;
            } else if (escaped == 'n') {
                value += '\n';
            } else {
                throw failure{"unknown escape in a label value"};
            }
        }
    }

    std::string_view text_;
    size_t at_ = 0;
};

std::string unescape_help(std::string_view text) {
    std::string out;
    for (size_t i = 0; i < text.size(); ++i) {
        if (text[i] != '\\') {
            out += text[i];
        } else if (i + 1 < text.size() && text[i + 1] == '\\') {
            out += '\\';
            ++i;
        } else if (i + 1 < text.size() && text[i + 1] == 'n') {
            out += '\n';
            ++i;
        } else {
            throw failure{"unknown escape in HELP"};
        }
    }
    return out;
}

class reader {
  public:
    void line(std::string_view text) {
        if (text.empty()) {
            return;
        }
        if (text[0] == '#') {
            comment(text);
            return;
        }
        sample s = sample_line(text).read();
        family &f = family_for(s.name, true);
        if (f.type != "untyped" && f.type != "histogram" && f.type != "summary" &&
            s.name != f.name) {
            throw failure{"sample " + s.name + " outside its family"};
        }
        std::string series = s.name;
        for (const auto &[name, value] : s.label_values) {
            series += "\x1f" + name + "=" + value;
        }
        if (!series_.insert(series).second) {
            throw failure{"series " + s.name + " given twice"};
        }
        doc.samples.push_back(std::move(s));
    }

    document doc;

  private:
    void comment(std::string_view text) {
        std::string_view rest = text.substr(1);
        while (!rest.empty() && rest[0] == ' ') {
            rest.remove_prefix(1);
        }
        bool help = rest.starts_with("HELP ");
        bool type = rest.starts_with("TYPE ");
        if (!help && !type) {
            return; // a plain comment
        }
        rest.remove_prefix(5);
        size_t end = rest.find(' ');
        std::string name(rest.substr(0, end));
        std::string_view body = end == std::string_view::npos ? "" : rest.substr(end + 1);
        if (!is_metric_name(name)) {
            throw failure{"bad metric name '" + name + "'"};
        }
        bool known = find(name) != nullptr;
        family &f = family_for(name, false);
        if (help) {
            if (!helped_.insert(name).second) {
                throw failure{"HELP of " + name + " twice"};
            }
            f.help = unescape_help(body);
            return;
        }
        if (!typed_.insert(name).second) {
            throw failure{"TYPE of " + name + " twice"};
        }
        if (known && sampled_.contains(name)) {
            throw failure{"TYPE of " + name + " after its samples"};
        }
        bool valid = false;
        for (std::string_view t : TYPES) {
            valid = valid || body == t;
        }
        if (!valid) {
            throw failure{"unknown type '" + std::string(body) + "'"};
        }
        f.type = std::string(body);
    }

    family *find(const std::string &name) {
        for (family &f : doc.families) {
            if (f.name == name) {
                return &f;
            }
        }
        return nullptr;
    }

    // The family of a HELP, TYPE or sample line; its lines must stand together.
    family &family_for(const std::string &name, bool from_sample) {
        family *f = find(name);
        if (from_sample && f == nullptr) {
            // The sample of a histogram or summary carries a suffix of its family's name.
            for (family &candidate : doc.families) {
                if (name.starts_with(candidate.name) &&
                    (candidate.type == "histogram" || candidate.type == "summary")) {
                    f = &candidate;
                }
            }
        }
        if (f == nullptr) {
            doc.families.push_back({name, "untyped", ""});
            f = &doc.families.back();
        } else if (f != &doc.families.back()) {
            throw failure{"the lines of " + name + " do not stand together"};
        }
        if (from_sample) {
            sampled_.insert(f->name);
        }
        return *f;
    }

    std::set<std::string> helped_, typed_, sampled_, series_;
};

} // namespace

reading parse(std::string_view text) {
    reading result;
    reader r;
    size_t number = 0;
    if (!is_utf8(text)) {
        result.error = "not UTF-8";
        return result;
    }
    if (!text.empty() && text.back() != '\n') {
        result.error = "the last line has no line end";
        return result;
    }
    try {
        size_t start = 0;
        while (start < text.size()) {
            size_t end = text.find('\n', start);
            ++number;
            r.line(text.substr(start, end - start));
            start = end + 1;
        }
    } catch (const failure &f) {
        result.error = "line " + std::to_string(number) + ": " + f.what;
        return result;
    }
    result.doc = std::move(r.doc);
    return result;
}

std::optional<double> document::value(std::string_view name, const labels &with) const {
    for (const sample &s : samples) {
        if (s.name == name && s.label_values == with) {
            return s.value;
        }
    }
    return std::nullopt;
}

std::vector<sample> document::samples_of(std::string_view name) const {
    std::vector<sample> found;
    for (const sample &s : samples) {
        if (s.name == name) {
            found.push_back(s);
        }
    }
    return found;
}

const family *document::family_of(std::string_view name) const {
    for (const family &f : families) {
        if (f.name == name) {
            return &f;
        }
    }
    return nullptr;
}

} // namespace prometheus
