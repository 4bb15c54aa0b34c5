// The weighing of process name expressions: which repetitions the budget lets through to the
// compiler, read as the basic syntax reads them.
#include <gtest/gtest.h>

#include <random>
#include <string>
#include <string_view>
#include <vector>

#include "core/expression_budget.h"

namespace {

const std::string COUNT = "a counted repetition asks for more than 255 copies";
const std::string NESTED = "counted repetitions nested in groups multiply to more than 255 copies";
const std::string EXPANSION = "its repetitions would expand it by more than 512 parts";
const std::string NESTING = "groups nested more than 128 deep";

// The reason of the verdict, or "" when the expression is within the budget.
std::string verdict(std::string_view expression) {
    expression_weight weight = weigh_expression(expression);
    EXPECT_EQ(weight.within_budget, weight.reason == nullptr) << expression;
    return weight.reason == nullptr ? "" : weight.reason;
}

std::string repeated(std::string_view unit, int times) {
    std::string text;
    for (int i = 0; i < times; ++i) {
        text += unit;
    }
    return text;
}

TEST(ExpressionBudget, ExpressionsWithoutRepetitionsAreWithin) {
    for (const char *expression : {"",
                                   "^java$",
                                   "a*",
                                   ".*",
                                   "^/usr/bin/python[0-9.]*$",
                                   "[[:alpha:]]*x",
                                   "\\(a*\\)*",
                                   "\\(sshd\\|httpd\\)",
                                   "\\<db\\>",
                                   "\\bword\\b",
                                   "\\(a\\)\\1",
                                   "\\",
                                   "\\(",
                                   "\\)",
                                   "[",
                                   "[]",
                                   "a\\{",
                                   "a\\{1",
                                   "a\\{1,",
                                   "a\\{1,2"}) {
        EXPECT_EQ(verdict(expression), "");
    }
    EXPECT_EQ(verdict(std::string(249, 'x')), "");
    EXPECT_EQ(verdict(repeated("\\(\\)*", 49)), "");
    EXPECT_EQ(verdict(repeated("\\b", 124)), ""); // costly, but nothing repeats it
}

TEST(ExpressionBudget, OneCountAtMost255) {
    EXPECT_EQ(verdict("a\\{255\\}"), "");
    EXPECT_EQ(verdict("a\\{1,255\\}"), "");
    EXPECT_EQ(verdict("a\\{0,255\\}"), "");
    EXPECT_EQ(verdict("a\\{,255\\}"), "");
    EXPECT_EQ(verdict("a\\{255,\\}"), "");
    EXPECT_EQ(verdict("a\\{256\\}"), COUNT);
    EXPECT_EQ(verdict("a\\{1,256\\}"), COUNT);
    EXPECT_EQ(verdict("a\\{,256\\}"), COUNT);
    EXPECT_EQ(verdict("a\\{256,\\}"), COUNT);
    EXPECT_EQ(verdict("a\\{1,32767\\}"), COUNT);
    // The larger number is the count, whichever comes first (the compiler refuses the second).
    EXPECT_EQ(verdict("a\\{256,1\\}"), COUNT);
    EXPECT_EQ(verdict("[[:alpha:]]\\{256\\}"), COUNT);
    EXPECT_EQ(verdict("\\(ab\\)\\{1,256\\}"), COUNT);
}

TEST(ExpressionBudget, AnEscapedCommaIsTheComma) {
    EXPECT_EQ(verdict("a\\{2\\,32767\\}"), COUNT);
    EXPECT_EQ(verdict("a\\{1\\,255\\}"), "");
    EXPECT_EQ(verdict("a\\{\\,256\\}"), COUNT);
    EXPECT_EQ(verdict("\\(ab\\)\\{171\\,\\}"), EXPANSION);
    EXPECT_EQ(verdict("\\(a\\{1\\,16\\}\\)\\{1\\,16\\}"), NESTED);
}

TEST(ExpressionBudget, AnEscapedZeroIsTheDigit) {
    EXPECT_EQ(verdict("a\\{2\\0,32767\\}"), COUNT);
    EXPECT_EQ(verdict("a\\{3\\0\\0\\}"), COUNT);
    EXPECT_EQ(verdict("a\\{2\\05\\}"), "");
    EXPECT_EQ(verdict("a\\{1,2\\0\\0\\}"), "");
    // Other escaped digits are back-references: the compiler refuses the count.
    EXPECT_EQ(verdict("a\\{3\\1\\0\\}"), "");
}

TEST(ExpressionBudget, NumbersTooLongForAnIntAreHeldAtTheirCeiling) {
    EXPECT_EQ(verdict("a\\{99999999999999999999999999999999\\}"), COUNT);
    EXPECT_EQ(verdict("a\\{1,184467440737095516170\\}"), COUNT);
    EXPECT_EQ(verdict("a\\{0000000000000000000000000000255\\}"), "");
}

TEST(ExpressionBudget, NestedCountsMultiply) {
    EXPECT_EQ(verdict("\\(a\\{1,15\\}\\)\\{1,17\\}"), "");
    EXPECT_EQ(verdict("\\(a\\{1,16\\}\\)\\{1,16\\}"), NESTED);
    EXPECT_EQ(verdict("\\(\\(a\\{1,5\\}\\)\\{1,3\\}\\)\\{1,17\\}"), "");
    EXPECT_EQ(verdict("\\(\\(a\\{1,5\\}\\)\\{1,3\\}\\)\\{1,18\\}"), NESTED);
    // The deepest product counts, not the sum of the group's items.
    EXPECT_EQ(verdict("\\(a\\{1,100\\}\\|b\\)\\{1,2\\}"), "");
    EXPECT_EQ(verdict("\\(a\\{1,100\\}b\\{1,2\\}\\)\\{1,3\\}"), NESTED);
    // A group without a count passes its contents' product on.
    EXPECT_EQ(verdict("\\(\\(a\\{1,16\\}\\)\\)\\{1,16\\}"), NESTED);
    // A group of count 0 is still built once, with its contents.
    EXPECT_EQ(verdict("\\(a\\{1,255\\}\\)\\{0\\}"), "");
    EXPECT_EQ(verdict("\\(a\\{1,256\\}\\)\\{0\\}"), COUNT);
    // Stacked counts (which the compiler refuses) multiply like nested ones.
    EXPECT_EQ(verdict("a\\{1,16\\}\\{1,16\\}"), NESTED);
}

TEST(ExpressionBudget, CopiesOfAllCountsAddUp) {
    EXPECT_EQ(verdict("a\\{1,255\\}b\\{1,255\\}c\\{1,5\\}"), ""); // 254 + 254 + 4 added
    EXPECT_EQ(verdict("a\\{1,255\\}b\\{1,255\\}c\\{1,6\\}"), EXPANSION);
    EXPECT_EQ(verdict("\\(ab\\)\\{1,171\\}"), ""); // 3 parts, 170 more copies
    EXPECT_EQ(verdict("\\(ab\\)\\{1,172\\}"), EXPANSION);
    EXPECT_EQ(verdict("\\(ab\\)\\{171\\}"), "");
    EXPECT_EQ(verdict("\\(ab\\)\\{170,\\}"), ""); // 170 copies and one under a '*'
    EXPECT_EQ(verdict("\\(ab\\)\\{171,\\}"), EXPANSION);
    EXPECT_EQ(verdict("\\(a\\{1,15\\}\\)\\{1,17\\}" + std::string(230, 'x')), "");
    EXPECT_EQ(verdict(repeated("a\\{1,255\\}", 3)), EXPANSION);
    // The text as written never counts, however long.
    EXPECT_EQ(verdict(std::string(200, 'x') + "a\\{1,255\\}"), "");
}

TEST(ExpressionBudget, AnchorsWordBoundariesAndSkippablePartsWeighMore) {
    EXPECT_EQ(verdict("\\(^a\\)\\{1,29\\}"), ""); // 18 parts, 28 more copies
    EXPECT_EQ(verdict("\\(^a\\)\\{1,30\\}"), EXPANSION);
    EXPECT_EQ(verdict("\\(a^\\)\\{1,30\\}"), ""); // not at the start: an ordinary character
    EXPECT_EQ(verdict("\\(a$\\)\\{1,29\\}"), "");
    EXPECT_EQ(verdict("\\(a$\\)\\{1,30\\}"), EXPANSION);
    EXPECT_EQ(verdict("\\(\\<a\\>\\)\\{1,16\\}"), "");
    EXPECT_EQ(verdict("\\(\\<a\\>\\)\\{1,17\\}"), EXPANSION);
    EXPECT_EQ(verdict("\\(\\ba\\)\\{1,4\\}"), "");
    EXPECT_EQ(verdict("\\(\\ba\\)\\{1,5\\}"), EXPANSION);
    EXPECT_EQ(verdict("\\(\\<\\)\\{1,255\\}"), EXPANSION);
    // A copy that may be left out of a part that can match nothing.
    EXPECT_EQ(verdict("\\(a*\\)\\{1,4\\}"), "");
    EXPECT_EQ(verdict("\\(a*\\)\\{1,5\\}"), EXPANSION);
    EXPECT_EQ(verdict("\\(a*\\)\\{5\\}"), ""); // none may be left out
    EXPECT_EQ(verdict("\\(a*b\\)\\{1,255\\}"), EXPANSION);
    EXPECT_EQ(verdict("\\(a*b\\)\\{1,171\\}"), "");
    EXPECT_EQ(verdict("\\(\\)\\{0,1\\}\\(\\)\\{0,1\\}\\(\\)\\{0,1\\}\\(\\)\\{0,1\\}"), "");
    EXPECT_EQ(verdict(repeated("\\(\\)\\{0,1\\}", 5)), EXPANSION);
    // A '*' over a part that can match nothing weighs in every copy of it.
    EXPECT_EQ(verdict("\\(\\(\\)*\\)\\{4\\}"), "");
    EXPECT_EQ(verdict("\\(\\(\\)*\\)\\{5\\}"), EXPANSION);
    // An alternative that can match nothing beside another such.
    EXPECT_EQ(verdict("\\(a\\|\\)\\{255\\}"), "");
    EXPECT_EQ(verdict("\\(\\|\\)\\{4\\}"), "");
    EXPECT_EQ(verdict("\\(\\|\\)\\{5\\}"), EXPANSION);
    // A back-reference matches nothing when its group did.
    EXPECT_EQ(verdict("\\(a*\\)\\1\\{1,4\\}"), "");
    EXPECT_EQ(verdict("\\(a*\\)\\1\\{1,5\\}"), EXPANSION);
}

TEST(ExpressionBudget, ShortFormsCountAsTheCountsTheyStandFor) {
    EXPECT_EQ(verdict(repeated("\\(\\)\\?", 4)), "");
    EXPECT_EQ(verdict(repeated("\\(\\)\\?", 5)), EXPANSION);
    EXPECT_EQ(verdict("a" + repeated("\\+", 9)), ""); // 512 copies, 511 added
    EXPECT_EQ(verdict("a" + repeated("\\+", 10)), EXPANSION);
    // "a\?" can match nothing: each "\?" after it is a place to take or skip.
    EXPECT_EQ(verdict("a" + repeated("\\?", 5)), "");
    EXPECT_EQ(verdict("a" + repeated("\\?", 6)), EXPANSION);
    // A plain '*' adds no copy.
    EXPECT_EQ(verdict(repeated("\\(\\(\\)*\\)*", 20)), "");
}

TEST(ExpressionBudget, InsideBracketsBackslashAndCountAreMembers) {
    for (const char *expression :
         {"[\\{1,999\\}]", "[]\\{1,999\\}]", "[^]\\{1,999\\}]", "[[:alpha:]\\{1,999\\}]",
          "[[=a=]\\{1,999\\}]", "[[.-.]\\{1,999\\}]", "[[.].]\\{1,999\\}]", "[\\(]\\{1,255\\}"}) {
        EXPECT_EQ(verdict(expression), "") << expression;
    }
    // The bracket ends at its first ']' that is not its first member; a count after it counts.
    EXPECT_EQ(verdict("[]a]\\{1,256\\}"), COUNT);
    EXPECT_EQ(verdict("[^]a]\\{1,256\\}"), COUNT);
    EXPECT_EQ(verdict("[[:alpha:]]\\{1,256\\}"), COUNT);
    EXPECT_EQ(verdict("[[.].]]\\{1,256\\}"), COUNT);
    EXPECT_EQ(verdict("[a]]\\{1,256\\}"), COUNT); // "[a]" then the character ']'
    EXPECT_EQ(verdict("[a-]\\{1,256\\}"), COUNT); // a '-' last is a member
    EXPECT_EQ(verdict("[\\]\\{1,256\\}"), COUNT); // the set of one backslash
    // Unterminated, the bracket holds the rest of the text (and the compiler refuses it).
    EXPECT_EQ(verdict("[a\\{1,999\\}"), "");
    EXPECT_EQ(verdict("[[:alpha\\{1,999\\}]"), "");
}

TEST(ExpressionBudget, CountWithNothingToRepeatIsOrdinaryText) {
    // The compiler refuses these; they cost it nothing.
    for (const char *expression :
         {"\\{1,999\\}", "\\(\\{1,999\\}\\)", "x\\|\\{1,999\\}", "^\\{1,999\\}", "\\<\\{1,999\\}",
          "\\b\\{1,999\\}", "a\\{1,999x\\}", "a\\{ 1,999\\}", "a\\{\\}", "a\\{1,999"}) {
        EXPECT_EQ(verdict(expression), "") << expression;
    }
    // A '*' with nothing before it is an ordinary character, which a count may repeat.
    EXPECT_EQ(verdict("*\\{1,256\\}"), COUNT);
    EXPECT_EQ(verdict("\\(*\\{1,256\\}\\)"), COUNT);
    EXPECT_EQ(verdict("^*\\{1,256\\}"), COUNT);
    // Mid-expression '^' and '$' are ordinary characters too.
    EXPECT_EQ(verdict("a^\\{1,256\\}"), COUNT);
    EXPECT_EQ(verdict("a$\\{1,256\\}"), COUNT);
    // An escaped character is one.
    EXPECT_EQ(verdict("\\.\\{1,256\\}"), COUNT);
    EXPECT_EQ(verdict("\\\\\\{1,256\\}"), COUNT);
    EXPECT_EQ(verdict("\\w\\{1,256\\}"), COUNT);
}

TEST(ExpressionBudget, OpenGroupsCountWithTheirContents) {
    EXPECT_EQ(verdict("\\(\\(a\\{1,16\\}"), "");
    EXPECT_EQ(verdict("\\(\\(ab\\)\\{1,172\\}"), EXPANSION);
    EXPECT_EQ(verdict("a\\)\\{1,256\\}"), COUNT); // an unmatched "\)" is a character to it
}

TEST(ExpressionBudget, NestingBeyondWhatAMaskCanHold) {
    EXPECT_EQ(verdict(repeated("\\(", 128) + "a" + repeated("\\)", 128)), "");
    EXPECT_EQ(verdict(repeated("\\(", 129)), NESTING);
}

// Random texts of the syntax's pieces (and of stray bytes): the verdict and its reason agree, a
// text without a repetition is always within, a text wholly inside a bracket is always within,
// and the short forms weigh exactly as the counts they stand for.
TEST(ExpressionBudget, RandomExpressions) {
    const std::vector<std::string> pieces = {
        "a",   "b",   ".",    "*",   "^",   "$",   "[ab]", "[]a]", "[[:alpha:]]",
        "[",   "]",   "\\(",  "\\)", "\\|", "\\<", "\\>",  "\\b",  "\\B",
        "\\w", "\\1", "\\\\", "\\",  ",",   "1",   "\\}",  "\x80", std::string(1, '\0')};
    // Repetitions, each with its long form.
    const std::vector<std::pair<std::string, std::string>> repetitions = {
        {"\\?", "\\{0,1\\}"},       {"\\+", "\\{1,\\}"},       {"\\{2\\}", "\\{2\\}"},
        {"\\{0,3\\}", "\\{0,3\\}"}, {"\\{7,\\}", "\\{7,\\}"},  {"\\{1,40\\}", "\\{1,40\\}"},
        {"\\{256\\}", "\\{256\\}"}, {"\\{,17\\}", "\\{,17\\}"}};
    std::mt19937 random(20240611);
    for (int round = 0; round < 20000; ++round) {
        std::string plain;
        std::string short_forms;
        std::string long_forms;
        bool has_repetition = false;
        size_t length = random() % 60;
        for (size_t i = 0; i < length; ++i) {
            if (random() % 5 == 0) {
                const auto &[short_form, long_form] = repetitions[random() % repetitions.size()];
                short_forms += short_form;
                long_forms += long_form;
                has_repetition = true;
            } else {
                const std::string &piece = pieces[random() % pieces.size()];
                plain += piece;
                short_forms += piece;
                long_forms += piece;
            }
        }
        SCOPED_TRACE(short_forms);
        std::string short_verdict = verdict(short_forms);
        ASSERT_EQ(short_verdict, verdict(long_forms));
        if (!has_repetition) {
            ASSERT_EQ(short_verdict, "");
        }
        ASSERT_EQ(verdict(plain), "");
        std::string bracketed = short_forms;
        std::erase(bracketed, ']');
        ASSERT_EQ(verdict("[x" + bracketed + "]"), "");
    }
}

} // namespace
