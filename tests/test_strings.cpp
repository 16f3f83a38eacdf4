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
    Tokens tokens;
    for (int i = 0; i < CountStringList(list.get()); ++i)
        tokens.push_back(list[i]);
    EXPECT_EQ(list[tokens.size()], nullptr) << "the list is null-terminated";
    return tokens;
}

}  // namespace

TEST(StringList, SplitsAtEveryDelimiterCharacter) {
    EXPECT_EQ(Split("1\t2,3;4", "\t,;"), (Tokens{"1", "2", "3", "4"}));
    EXPECT_EQ(Split(" a b ", ","), (Tokens{" a b "}));
}

TEST(StringList, RunsAndEndsOfDelimitersGiveNoEmptyTokens) {
    EXPECT_EQ(Split(",,1,;\t2;;", "\t,;"), (Tokens{"1", "2"}));
    EXPECT_TRUE(Split(",;,", ",;").empty());
    EXPECT_TRUE(Split("", ",").empty());
    EXPECT_TRUE(Split(nullptr, ",").empty());
}

TEST(StringList, WithoutDelimitersTheWholeTextIsOneToken) {
    EXPECT_EQ(Split("a,b", ""), (Tokens{"a,b"}));
    EXPECT_EQ(Split("a,b", nullptr), (Tokens{"a,b"}));
}

TEST(StringList, NullListsAreEmptyAndIgnored) {
    EXPECT_EQ(CountStringList(nullptr), 0);
    DestroyStringList(nullptr);
}

TEST(StringList, TrimRemovesAllKindsOfWhiteSpaceAtBothEndsOnly) {
    EXPECT_EQ(TrimWhitespace(" \t\r\n\v\fa b\t c \n"), "a b\t c");
    EXPECT_EQ(TrimWhitespace(" \t "), "");
    EXPECT_EQ(TrimWhitespace(""), "");
    EXPECT_EQ(TrimWhitespace("x"), "x");
}

TEST(TokenizeStr, TokensAreTrimmed) {
    EXPECT_EQ(TokenizeStr("10.5 , 20.25 ,\t-3", "\t,;"), (Tokens{"10.5", "20.25", "-3"}));
}

TEST(TokenizeStr, TokenOfBlanksStaysAsEmptyElement) {
    EXPECT_EQ(TokenizeStr("1,  ,2", ","), (Tokens{"1", "", "2"}));
}

TEST(TokenizeStr, NoEntriesGiveEmptyList) {
    EXPECT_TRUE(TokenizeStr("", "\t,;").empty());
    EXPECT_TRUE(TokenizeStr(";;", "\t,;").empty());
}

TEST(TokenizeStr, LongTextsAndManyTokensAreKeptWhole) {
    std::string text;
    Tokens expected;
    for (int i = 0; i < 1000; ++i) {
        expected.push_back(std::string(300, static_cast<char>('a' + i % 26)));
        text += " " + expected.back() + " ;";
    }
    EXPECT_EQ(TokenizeStr(text, ";"), expected);
}

TEST(ConvexHull2D_DnC, CanBeMadeCopiedAndAssigned) {
    ConvexHull2D_DnC hull;
    ConvexHull2D_DnC copy(hull);
    ConvexHull2D_DnC other;
    EXPECT_EQ(&(other = copy), &other);
}
