#include "platform/MWTerminalText.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <string>
#include <utility>
#include <vector>

#include "support/FakeHost.h"

namespace {

TEST(MWTerminalText, LetsNothingThroughThatSteersATerminal) {
    const std::vector<std::pair<std::string, std::string>> cases = {
        {R"(plain "text" ~ é)", R"(plain "text" ~ é)"},
        {R"(not \n)", R"(not \\n)"},
        {"a\u202eb\u2068c\u2028", R"(a\342\200\256b\342\201\250c\342\200\250)"},
        {"\u20ac \U0001F600", "\u20ac \U0001F600"},
        {"\x1b[31mred\a\b\t\n\v\f\r\x7f", R"(\033[31mred\a\b\t\n\v\f\r\177)"},
        {std::string(1, '\0') + "1", R"(\0001)"},
        {"\u009b31m", R"(\302\23331m)"},  // the control sequence introducer as UTF-8
        {"\x9b\x33\xff", R"(\2333\377)"},
        {"cut \xe2\x82", R"(cut \342\202)"},
        {"\xed\xa0\x80 \xf4\x90\x80\x80", R"(\355\240\200 \364\220\200\200)"},  // no characters
        {"\xc1\x9b \xe0\x82\x9b", R"(\301\233 \340\202\233)"},                  // overlong forms
    };
    for (const auto& [text, shown] : cases) {
        EXPECT_EQ(MWTerminalText(text), shown);
    }
}

TEST(MWTerminalText, AnErrorIsEscapedForATerminalAlone) {
    FakeHost host;
    EXPECT_EQ(MWErrorText("a\033b"), "a\033b");
    host.terminals = {STDOUT_FILENO};
    EXPECT_EQ(MWErrorText("a\033b"), "a\033b");
    host.terminals = {STDERR_FILENO};
    EXPECT_EQ(MWErrorText("a\033b"), "a\\033b");
}

}  // namespace
