// The event log of the default platform: one JSON object a line.
#include <cerrno>
#include <cstring>
#include <map>
#include <optional>
#include <string>
#include <unistd.h>
#include <vector>

#include "logsvc.h"
#include "platform_test_support.h"

namespace {

using platform_test::read_lines;
using platform_test::set_variable;

// A flat JSON object of strings, integers and null, as the event log writes it. Strings are
// decoded (\uXXXX below 0x100 only, which is all the log writes); anything else fails the parse.
class FlatJson {
  public:
    static std::optional<std::map<std::string, std::optional<std::string>>>
    parse(const std::string &text) {
        FlatJson parser(text);
        std::map<std::string, std::optional<std::string>> fields;
        if (!parser.take('{')) {
            return std::nullopt;
        }
        do {
            std::string key;
            std::optional<std::string> value;
            if (!parser.string(&key) || !parser.take(':') || !parser.value(&value) ||
                fields.count(key) != 0) {
                return std::nullopt;
            }
            fields[key] = value;
        } while (parser.take(','));
        if (!parser.take('}') || parser.at != text.size()) {
            return std::nullopt;
        }
        return fields;
    }

  private:
    explicit FlatJson(const std::string &text) : text(text) {}
    bool take(char c) {
        if (at < text.size() && text[at] == c) {
            ++at;
            return true;
        }
        return false;
    }
    bool value(std::optional<std::string> *out) {
        if (text.compare(at, 4, "null") == 0) {
            at += 4;
            *out = std::nullopt;
            return true;
        }
        if (at < text.size() && text[at] >= '0' && text[at] <= '9') {
            size_t start = at;
            while (at < text.size() && text[at] >= '0' && text[at] <= '9') {
                ++at;
            }
            *out = text.substr(start, at - start);
            return true;
        }
        std::string decoded;
        if (!string(&decoded)) {
            return false;
        }
        *out = decoded;
        return true;
    }
    bool string(std::string *out) {
        if (!take('"')) {
            return false;
        }
        while (at < text.size() && text[at] != '"') {
            auto c = static_cast<unsigned char>(text[at++]);
            if (c < 0x20) {
                return false; // raw control characters are not JSON
            }
            if (c != '\\') {
                *out += static_cast<char>(c);
                continue;
            }
            if (at >= text.size()) {
                return false;
            }
            char escape = text[at++];
            static const std::map<char, char> simple = {{'"', '"'},  {'\\', '\\'}, {'/', '/'},
                                                        {'n', '\n'}, {'r', '\r'},  {'t', '\t'},
                                                        {'b', '\b'}, {'f', '\f'}};
            if (auto found = simple.find(escape); found != simple.end()) {
                *out += found->second;
            } else if (escape == 'u' && at + 4 <= text.size()) {
                unsigned long code = std::stoul(text.substr(at, 4), nullptr, 16);
                if (code > 0xFF) {
                    return false;
                }
                *out += static_cast<char>(code);
                at += 4;
            } else {
                return false;
            }
        }
        return take('"');
    }
    const std::string &text;
    size_t at = 0;
};

logsvc_record event(uint32_t option, uint16_t reason, uint32_t comp_rc, const char *attachment) {
    logsvc_record record{};
    record.record_type = LOGSVC_RECORD_TYPE_EVENT;
    record.option = option;
    std::strncpy(record.component, "LinMonitor", sizeof record.component);
    record.reason_code = reason;
    record.comp_rc = comp_rc;
    record.attachment = const_cast<char *>(attachment);
    record.attachment_length = attachment != nullptr ? std::strlen(attachment) : 0;
    return record;
}

class PlatformEventLog : public platform_test::PlatformTest {
  protected:
    // Logs the record and returns the parsed fields of the last line of the log.
    std::map<std::string, std::optional<std::string>> log(logsvc_record record) {
        uint32_t crc = 77;
        EXPECT_EQ(logsvc_microcode_log(&record, &crc), 0u);
        EXPECT_EQ(crc, 0u);
        std::vector<std::string> lines = read_lines(event_path());
        if (lines.empty()) {
            ADD_FAILURE() << "no event written";
            return {};
        }
        auto fields = FlatJson::parse(lines.back());
        if (!fields) {
            ADD_FAILURE() << "not a JSON object: " << lines.back();
            return {};
        }
        return *fields;
    }
};

TEST_F(PlatformEventLog, AnEventIsOneJsonLineWithEveryField) {
    auto fields = log(event(LOGSVC_REPORT_ERROR, 0xE081, 0x2A, nullptr));
    ASSERT_EQ(fields.size(), 8u);
    EXPECT_EQ(fields["reason"], "0xE081");
    EXPECT_EQ(fields["severity"], "error");
    EXPECT_EQ(fields["component"], "LinMonitor");
    EXPECT_EQ(fields["option"], "0x300");
    EXPECT_EQ(fields["compRc"], "0x2A");
    EXPECT_EQ(fields["attachment"], std::nullopt);
    EXPECT_EQ(fields["pid"], std::to_string(::getpid()));
    ASSERT_TRUE(fields["time"].has_value());
    EXPECT_EQ(fields["time"]->size(), 24u);
    EXPECT_EQ(fields["time"]->back(), 'Z');
    EXPECT_EQ(fields["time"]->at(10), 'T');
}

TEST_F(PlatformEventLog, SeverityComesFromTheOptionWord) {
    struct Case {
        uint32_t option;
        const char *severity;
        const char *text;
    };
    const Case cases[] = {
        {0x300, "error", "0x300"},           {0x200, "informational", "0x200"},
        {0xC300, "error", "0xC300"},         {0xC200, "informational", "0xC200"},
        {0xC000, "error", "0xC000"},         {0x100, "error", "0x100"},
        {0x4200, "informational", "0x4200"}, {0, "error", "0x0"},
    };
    for (const Case &c : cases) {
        auto fields = log(event(c.option, 0xE0F1, 0, nullptr));
        EXPECT_EQ(fields["severity"], c.severity) << std::hex << c.option;
        EXPECT_EQ(fields["option"], c.text);
    }
    EXPECT_EQ(read_lines(event_path()).size(), std::size(cases));
}

TEST_F(PlatformEventLog, ReasonAndCompRcAreUpperCaseHex) {
    auto fields = log(event(LOGSVC_REPORT_ERROR, 0x00AB, 0xDEADBEEF, nullptr));
    EXPECT_EQ(fields["reason"], "0x00AB");
    EXPECT_EQ(fields["compRc"], "0xDEADBEEF");
    fields = log(event(LOGSVC_REPORT_ERROR, 0xE170, 0, nullptr));
    EXPECT_EQ(fields["reason"], "0xE170");
    EXPECT_EQ(fields["compRc"], "0x0");
}

TEST_F(PlatformEventLog, TheAttachmentIsEscapedJsonText) {
    const char *attachment =
        "Memory check\n\rquote \" backslash \\ tab\t bell\x07 end of data \n\r";
    auto fields = log(event(0xC300, 0xE117, 5, attachment));
    EXPECT_EQ(fields["attachment"], attachment);
    std::string raw = read_lines(event_path()).back();
    EXPECT_NE(raw.find(R"("attachment":"Memory check\n\rquote \" backslash \\ tab\t bell\u0007)"),
              std::string::npos)
        << raw;
}

TEST_F(PlatformEventLog, OnlyTheAttachmentLengthIsTaken) {
    logsvc_record record = event(0xC300, 0xE117, 5, "abcdef");
    record.attachment_length = 3;
    EXPECT_EQ(log(record)["attachment"], "abc");
    record.attachment_length = 0;
    EXPECT_EQ(log(record)["attachment"], "");
}

TEST_F(PlatformEventLog, AComponentFillingAllTwelveBytesIsBounded) {
    logsvc_record record = event(LOGSVC_REPORT_ERROR, 0xE081, 0, nullptr);
    std::memcpy(record.component, "ABCDEFGHIJKL", 12);
    record.reason_code = 0xE082; // the byte after the component is not part of it
    EXPECT_EQ(log(record)["component"], "ABCDEFGHIJKL");
}

TEST_F(PlatformEventLog, EventsAppend) {
    log(event(LOGSVC_REPORT_ERROR, 0xE081, 1, nullptr));
    log(event(LOGSVC_REPORT_ERROR, 0xE082, 2, "x"));
    std::vector<std::string> lines = read_lines(event_path());
    ASSERT_EQ(lines.size(), 2u);
    EXPECT_EQ((*FlatJson::parse(lines[0]))["reason"], "0xE081");
    EXPECT_EQ((*FlatJson::parse(lines[1]))["reason"], "0xE082");
}

TEST_F(PlatformEventLog, TheEventLogVariableNamesTheFile) {
    std::string elsewhere = dir + "/other.events";
    set_variable("TELV_EVENT_LOG", elsewhere);
    logsvc_record record = event(LOGSVC_REPORT_ERROR, 0xE081, 0, nullptr);
    uint32_t crc = 77;
    EXPECT_EQ(logsvc_microcode_log(&record, &crc), 0u);
    EXPECT_EQ(read_lines(elsewhere).size(), 1u);
    EXPECT_FALSE(platform_test::exists(event_path()));
}

TEST_F(PlatformEventLog, ARecordThatIsNoEventIsRefused) {
    logsvc_record record = event(LOGSVC_REPORT_ERROR, 0xE081, 0, nullptr);
    record.record_type = 17;
    uint32_t crc = 0;
    EXPECT_NE(logsvc_microcode_log(&record, &crc), 0u);
    EXPECT_EQ(crc, static_cast<uint32_t>(EINVAL));
    crc = 0;
    EXPECT_NE(logsvc_microcode_log(nullptr, &crc), 0u);
    EXPECT_EQ(crc, static_cast<uint32_t>(EINVAL));
    EXPECT_NE(logsvc_microcode_log(nullptr, nullptr), 0u);
    EXPECT_FALSE(platform_test::exists(event_path()));
}

TEST_F(PlatformEventLog, AFailedWriteGivesItsErrno) {
    logsvc_record record = event(LOGSVC_REPORT_ERROR, 0xE081, 0, "text");
    set_variable("TELV_EVENT_LOG", "/dev/full");
    uint32_t crc = 0;
    EXPECT_NE(logsvc_microcode_log(&record, &crc), 0u);
    EXPECT_EQ(crc, static_cast<uint32_t>(ENOSPC));
    set_variable("TELV_EVENT_LOG", dir);
    crc = 0;
    EXPECT_NE(logsvc_microcode_log(&record, &crc), 0u);
    EXPECT_EQ(crc, static_cast<uint32_t>(EISDIR));
    set_variable("TELV_EVENT_LOG", dir + "/no/such/dir/events");
    crc = 0;
    EXPECT_NE(logsvc_microcode_log(&record, &crc), 0u);
    EXPECT_EQ(crc, static_cast<uint32_t>(ENOENT));
}

TEST_F(PlatformEventLog, ALargeAttachmentIsWrittenWhole) {
    std::string attachment;
    for (int i = 0; i < 3000; ++i) {
        attachment += "line " + std::to_string(i) + " of the snapshot \n\r";
    }
    EXPECT_EQ(log(event(0xC300, 0xE117, 0, attachment.c_str()))["attachment"], attachment);
}

} // namespace
