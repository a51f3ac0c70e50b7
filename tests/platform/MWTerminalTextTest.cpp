#include "platform/MWTerminalText.h"

#include <gtest/gtest.h>

namespace {

TEST(MWTerminalText, LetsNothingThroughThatSteersATerminal) {
    EXPECT_EQ(MWTerminalText("plain \"text\" ~"), "plain \"text\" ~");
    EXPECT_EQ(MWTerminalText("\x1b[31mred\n\t\x7f"), "?[31mred???");
    EXPECT_EQ(MWTerminalText("é \u20ac \U0001F600"), "é \u20ac \U0001F600");
    EXPECT_EQ(MWTerminalText("\u009b31m"), "??31m") << "the control sequence introducer as UTF-8";
    EXPECT_EQ(MWTerminalText("\x9b"
                             "31m\xff"),
              "?31m?");
    EXPECT_EQ(MWTerminalText("cut \xe2\x82"), "cut ??");
    EXPECT_EQ(MWTerminalText("\xed\xa0\x80 \xf4\x90\x80\x80"), "??? ????") << "no characters";
    EXPECT_EQ(MWTerminalText("\xc1\x9b \xe0\x82\x9b \xf0\x80\x80\x80"), "?? ??? ????") << "overlong forms";
}

}  // namespace
