#include <kestrel/stringlist.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <vector>

#if defined(_WIN32)
#include <locale.h>
#else
#include <locale.h>
#if defined(__APPLE__)
#include <xlocale.h>
#endif
#endif

namespace {

// Frees the strings of a list under construction when building it fails half way.
struct ListBuilder {
    std::vector<char*> entries;
    ~ListBuilder() {
        for (char* entry : entries)
            delete[] entry;
    }
};

char* CopyOf(const char* begin, std::size_t length) {
    char* copy = new char[length + 1];
    std::memcpy(copy, begin, length);
    copy[length] = '\0';
    return copy;
}

}  // namespace

char** TokenizeDelim(const char* text, const char* delimiters) {
    if (delimiters == nullptr)
        delimiters = "";
    ListBuilder builder;
    if (text != nullptr) {
        const char* p = text;
        while (*p != '\0') {
            p += std::strspn(p, delimiters);
            if (*p == '\0')
                break;
            const std::size_t length = std::strcspn(p, delimiters);
            builder.entries.reserve(builder.entries.size() + 1);
            builder.entries.push_back(CopyOf(p, length));
            p += length;
        }
    }
    char** list = new char*[builder.entries.size() + 1];
    std::copy(builder.entries.begin(), builder.entries.end(), list);
    list[builder.entries.size()] = nullptr;
    builder.entries.clear();  // the list owns the strings now
    return list;
}

int CountStringList(const char* const* list) {
    int count = 0;
    if (list != nullptr) {
        while (list[count] != nullptr)
            ++count;
    }
    return count;
}

void DestroyStringList(char** list) {
    if (list == nullptr)
        return;
    for (char** entry = list; *entry != nullptr; ++entry)
        delete[] * entry;
    delete[] list;
}

std::string TrimWhitespace(const std::string& text) {
    static const char kWhite[] = " \t\r\n\v\f";
    const std::string::size_type first = text.find_first_not_of(kWhite);
    if (first == std::string::npos)
        return std::string();
    const std::string::size_type last = text.find_last_not_of(kWhite);
    return text.substr(first, last - first + 1);
}

double ClassicAtof(const char* text) {
    if (text == nullptr)
        return 0.0;
#if defined(_WIN32)
    static const _locale_t classic = _create_locale(LC_ALL, "C");
    return _strtod_l(text, nullptr, classic);
#else
    static const locale_t classic = newlocale(LC_ALL_MASK, "C", static_cast<locale_t>(0));
    return strtod_l(text, nullptr, classic);
#endif
}
