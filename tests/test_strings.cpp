// String helpers: the core library's string lists and TokenizeStr built on them.
#include <kestrel/stringlist.h>
#include <silvan/utils.h>

#include "support.h"

#include <memory>
#include <string>
#include <vector>

using Tokens = std::vector<std::string>;

namespace {

Tokens Split(const char* text, const char* delimiters) {
    std::unique_ptr<char*[], void (*)(char**)> list(TokenizeDelim(text, delimiters),
                                                    &DestroyStringList);
    Tokens tokens(list.get(), list.get() + CountStringList(list.get()));
    EXPECT_EQ(list[tokens.size()], nullptr) << "the list is null-terminated";
    return tokens;
}

}  // namespace

TEST(StringList, SplitsWithoutEmptyTokensAndTrimsBothEndsOnly) {
    EXPECT_EQ(Split(",,1\t2,3;;4;", "\t,;"), (Tokens{"1", "2", "3", "4"}));
    EXPECT_EQ(Split("a,b", ""), (Tokens{"a,b"}));
    EXPECT_EQ(Split("a,b", nullptr), (Tokens{"a,b"}));
    EXPECT_TRUE(Split(",;,", ",;").empty());
    EXPECT_TRUE(Split(nullptr, ",").empty());
    EXPECT_EQ(CountStringList(nullptr), 0);
    DestroyStringList(nullptr);
    EXPECT_EQ(TrimWhitespace(" \t\r\n\v\fa b\t c \n"), "a b\t c");
    EXPECT_EQ(TrimWhitespace(" \t "), "");
}

TEST(TokenizeStr, TrimsTokensAndKeepsBlankOnesAsEmpty) {
    EXPECT_EQ(TokenizeStr("10.5 , 20.25 ,\t-3", "\t,;"), (Tokens{"10.5", "20.25", "-3"}));
    EXPECT_EQ(TokenizeStr("1,  ,2", ","), (Tokens{"1", "", "2"}));
    EXPECT_TRUE(TokenizeStr(";;", "\t,;").empty());
}

TEST(TokenizeStr, LongTextsAndManyTokensAreKeptWhole) {
    std::string text;
    Tokens expected(1000, std::string(300, 'a'));
    for (const std::string& token : expected)
        text += " " + token + " ;";
    EXPECT_EQ(TokenizeStr(text, ";"), expected);
}

TEST(ConvexHull2D_DnC, IsExportedAndCopyable) {
    ConvexHull2D_DnC hull, other;
    ConvexHull2D_DnC copy(hull);
    EXPECT_EQ(&(other = copy), &other);
}
