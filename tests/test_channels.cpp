// Channel lists: channel numbers from the integer lists of parameter files.
#include <kestrel/channels.h>

#include "support.h"

#include <climits>
#include <vector>

using kestrel::DataException;

TEST(ExpandChannelList, PositiveNumbersMapToThemselvesInOrder) {
    std::vector<unsigned int> dbic{9, 9, 9, 9, 9};  // a previous line's channels are dropped
    ExpandChannelList({3, 1, 2, 2, INT_MAX}, dbic);
    EXPECT_EQ(dbic, (std::vector<unsigned int>{3, 1, 2, 2, 2147483647u}));

    ExpandChannelList({}, dbic);
    EXPECT_TRUE(dbic.empty());
}

// 0 and negative numbers name no channel: refused with the whole list, never wrapped to a huge
// channel number, and the caller's channels stay as they were.
TEST(ExpandChannelList, EntriesNamingNoChannelAreRefused) {
    const struct {
        std::vector<int> list;
        const char* message;
    } cases[] = {
        {{0}, "Channel list \"0\": entry 1 is 0"},
        {{1, -4}, "Channel list \"1,-4\": entry 2 is -4"},
        {{2, 3, INT_MIN, 5}, "Channel list \"2,3,-2147483648,5\": entry 3 is -2147483648"},
    };
    for (const auto& c : cases) {
        std::vector<unsigned int> dbic{7, 8};
        if (const auto e = testsupport::Thrown<DataException>(
                [&] { ExpandChannelList(c.list, dbic); }, c.message)) {
            EXPECT_EQ(e->GetErrorMessage().rfind(c.message, 0), 0u) << e->GetErrorMessage();
            EXPECT_TRUE(testsupport::Contains(e->GetFunction(), "ExpandChannelList"));
            EXPECT_EQ(e->GetSourceFile(), "channels.cpp");
        }
        EXPECT_EQ(dbic, (std::vector<unsigned int>{7, 8}));
    }
}
