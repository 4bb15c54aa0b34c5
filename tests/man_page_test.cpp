// telvzopt.trm(5) as the build wrote it, against the settings table: every keyword has its entry in
// the KEYWORDS section with its unit, its default, its rule and an example line, and the section
// lists no keyword the parser does not read.
#include <gtest/gtest.h>

#include <cstdlib>
#include <fstream>
#include <sstream>
#include <string>
#include <string_view>

#include "core/settings.h"

namespace {

std::string page_text() {
    const char *build = std::getenv("TARN_BUILD_DIR");
    std::ifstream in(std::string(build != nullptr ? build : ".") + "/man/telvzopt.trm.5");
    std::ostringstream text;
    text << in.rdbuf();
    return text.str();
}

// Plain words as the page writes them in roff: a minus sign escaped.
std::string as_roff(std::string_view words) {
    std::string out;
    for (char c : words) {
        out += c == '-' ? std::string("\\-") : std::string(1, c);
    }
    return out;
}

// The KEYWORDS section of the page: from its heading to the next section.
std::string keywords_section(const std::string &page) {
    size_t begin = page.find(".SH KEYWORDS\n");
    if (begin == std::string::npos) {
        return "";
    }
    size_t end = page.find("\n.SH ", begin + 1);
    return page.substr(begin, end == std::string::npos ? std::string::npos : end - begin);
}

// The entry of `keyword`: from its tag to the end of its indented block.
std::string entry_of(const std::string &section, std::string_view keyword) {
    std::string tag = ".TP\n.B " + std::string(keyword) + "\n";
    size_t begin = section.find(tag);
    if (begin == std::string::npos) {
        return "";
    }
    size_t end = section.find(".RE\n", begin);
    return section.substr(begin, end == std::string::npos ? std::string::npos : end - begin);
}

class ManPage : public testing::Test {
  protected:
    void SetUp() override {
        reset_settings();
        settings_start_values();
    }
    void TearDown() override { reset_settings(); }
};

TEST_F(ManPage, EveryKeywordHasItsEntry) {
    std::string section = keywords_section(page_text());
    ASSERT_FALSE(section.empty()) << "no KEYWORDS section in BUILD/man/telvzopt.trm.5";
    size_t count = 0;
    const setting *table = settings_table(&count);
    for (size_t i = 0; i < count; ++i) {
        const setting &entry = table[i];
        std::string text = entry_of(section, entry.keyword);
        ASSERT_FALSE(text.empty()) << entry.keyword << " is not in telvzopt.trm(5)";
        EXPECT_NE(text.find(as_roff(entry.unit)), std::string::npos) << entry.keyword;
        EXPECT_NE(text.find("\nValue:\n"), std::string::npos) << entry.keyword;
        EXPECT_NE(text.find("\nDefault:\n"), std::string::npos) << entry.keyword;
        if (entry.rule != nullptr) {
            EXPECT_NE(text.find("\nRule:\n" + as_roff(entry.rule->text)), std::string::npos)
                << entry.keyword;
        } else {
            EXPECT_NE(text.find("\nRule:\nnone."), std::string::npos) << entry.keyword;
        }
        EXPECT_NE(text.find("\nExample:\n.B \"" + std::string(entry.keyword)), std::string::npos)
            << entry.keyword;
    }
}

// The default shown is the value the setting has when the file does not give it.
TEST_F(ManPage, DefaultsAreTheStartValues) {
    std::string section = keywords_section(page_text());
    size_t count = 0;
    const setting *table = settings_table(&count);
    for (size_t i = 0; i < count; ++i) {
        const setting &entry = table[i];
        if (entry.handling == setting_handling::flag ||
            entry.handling == setting_handling::row_counter) {
            continue;
        }
        std::string expected = "\nDefault:\n" + std::to_string(setting_current(entry));
        EXPECT_NE(entry_of(section, entry.keyword).find(expected), std::string::npos)
            << entry.keyword;
    }
    EXPECT_NE(entry_of(section, "CHECKING_INTERVAL").find("\nDefault:\n60."), std::string::npos);
}

// No entry for a keyword the parser does not read.
TEST_F(ManPage, NoOtherKeywords) {
    std::string section = keywords_section(page_text());
    size_t count = 0;
    settings_table(&count);
    size_t entries = 0;
    for (size_t at = section.find(".TP\n.B "); at != std::string::npos;
         at = section.find(".TP\n.B ", at + 1)) {
        ++entries;
    }
    EXPECT_EQ(entries, count);
}

} // namespace
