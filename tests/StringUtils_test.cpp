#include <gtest/gtest.h>

#include <climits>
#include <string>

#include "tessarine/StringUtils.h"

using namespace lumivale::tessarine;

namespace {

TEST(StringUtilsTest, QuotingReplacingAndNumberReadingFollowTheirRules) {
    EXPECT_EQ("\"collection_a:b\"", dbqueries::quoted("collection_a:b"));
    EXPECT_EQ("\"a\"b\"", dbqueries::quoted("a\"b"));  // nothing escaped

    EXPECT_EQ("aXbX", stringReplace("a{0}b{0}", "{0}", "X"));
    EXPECT_EQ("a{0}b", stringReplace("a{0}b", "", "X"));
    EXPECT_EQ("", stringReplace("", "{0}", "X"));
    EXPECT_EQ("{0}{0}", stringReplace("{0}", "{0}", "{0}{0}"));  // replacements are not searched again
    EXPECT_EQ("ba", stringReplace("aaa", "aa", "b"));             // left to right, no overlap
    EXPECT_EQ(std::string("a\0Yb", 4), stringReplace(std::string("a\0{0}b", 6), "{0}", "Y"));

    EXPECT_EQ(-17, stringToLongLong("  \t-17abc"));
    EXPECT_EQ(5, stringToLongLong("+5 6"));
    for (const char* none : {"", "   ", "abc12", "-"}) EXPECT_EQ(0, stringToLongLong(none)) << none;
    EXPECT_EQ(LLONG_MAX, stringToLongLong("99999999999999999999"));
    EXPECT_EQ(LLONG_MIN, stringToLongLong("-99999999999999999999"));
}

}  // namespace
