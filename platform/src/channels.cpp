#include <kestrel/channels.h>

#include <kestrel/exception.h>

#include <cstddef>
#include <string>

namespace {

// The list as it is written in a parameter file: "1,2,3".
std::string ListText(const std::vector<int>& list) {
    std::string text;
    for (std::size_t i = 0; i < list.size(); ++i) {
        if (i > 0)
            text += ',';
        text += std::to_string(list[i]);
    }
    return text;
}

}  // namespace

void ExpandChannelList(const std::vector<int>& list, std::vector<unsigned int>& dbic) {
    // Checked before dbic is touched, so that a bad list leaves the caller's channels as they were.
    for (std::size_t i = 0; i < list.size(); ++i) {
        if (list[i] <= 0) {
            KESTREL_THROW(kestrel::DataException,
                          kestrel::FormatString("Channel list \"%s\": entry %zu is %d, which names "
                                                "no channel (channels are numbered from 1)",
                                                ListText(list).c_str(), i + 1, list[i]));
        }
    }
    dbic.clear();
    dbic.reserve(list.size());
    for (const int channel : list)
        dbic.push_back(static_cast<unsigned int>(channel));
}
