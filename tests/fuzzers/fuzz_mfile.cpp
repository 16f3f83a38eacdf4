// Reads arbitrary bytes as each of the four parameter files through the parsers' public entry
// points (constructors, copies, ParseLine with channel-list expansion); a master file that
// reads is written to both derived files, which must read back with one record for every
// master line (the image-set file: for every line whose role is not a preparation role).
#include <kestrel/exception.h>
#include <kestrel/file.h>
#include <silvan/filelistparser.h>
#include <silvan/toimgsetparser.h>
#include <silvan/tomfileparser.h>
#include <silvan/tpmfileparser.h>

#include <memory>
#include <string>
#include <vector>

#include "fuzz_input.h"

using namespace kestrel::processes::silvan;

namespace {

constexpr unsigned int kMaxLines = 64;  // keeps one run short

template <class Parser>
void Walk(Parser& parser) {
    for (unsigned int line = 0; line < parser.GetMfileLines() && line < kMaxLines; ++line) {
        try {
            parser.ParseLine(static_cast<int>(line));
        } catch (const kestrel::DataException&) {
        }
    }
    Parser copy(parser);
    try {
        copy.ParseLine(0);
    } catch (const kestrel::DataException&) {
    }
}

std::unique_ptr<TPMFileParser> OpenPrep(const std::string& path) {
    std::vector<unsigned int> dbic{1, 2};
    std::vector<int> dbiw{0, 16};
    return std::make_unique<TPMFileParser>(path, dbic, 1, dbiw, "0", 5);
}

// Column 0 of every line, as the file-list parser reads it; null when a line cannot be read.
std::unique_ptr<std::vector<std::string>> Names(const std::string& path) {
    auto names = std::make_unique<std::vector<std::string>>();
    FileListParser list(path);
    for (unsigned int line = 0; line < list.GetMfileLines(); ++line) {
        try {
            list.ParseLine(static_cast<int>(line));
        } catch (const kestrel::DataException&) {
            return nullptr;
        }
        names->push_back(list.GetFili());
    }
    return names;
}

std::string TrimBlanks(const std::string& text) {
    const std::size_t first = text.find_first_not_of(" \t");
    if (first == std::string::npos)
        return std::string();
    return text.substr(first, text.find_last_not_of(" \t") - first + 1);
}

void WriteAndReadBack(const std::string& master) {
    TOMFileParser parser(master);
    const FuzzDir& dir = FuzzDir::Get();
    const std::string prep = dir.Path("prep.txt");
    const std::string imgset = dir.Path("imgset.txt");
    try {
        parser.WriteMFilePrep(prep);
    } catch (const kestrel::DataException&) {
        return;  // a value the writer refuses: nothing written
    }
    auto prepParser = OpenPrep(prep);
    FUZZ_EXPECT(prepParser->GetMfileLines() == parser.GetMfileLines());
    Walk(*prepParser);
    const auto masterNames = Names(master);
    const auto prepNames = Names(prep);
    FUZZ_EXPECT(masterNames && prepNames && *masterNames == *prepNames);

    try {
        parser.WriteImgSet(imgset);
    } catch (const kestrel::DataException&) {
        return;
    }
    // The roles, read from the master file as the writer reads them.
    kestrel::MFileParser reader(0);
    std::unique_ptr<kestrel::ParametersTableIF> table(reader.Create(master));
    for (int column = 0; column < 9; ++column)
        table->AddDefaultString("");
    std::vector<std::string> expected;
    for (unsigned int line = 0; line < table->GetLineCount(); ++line) {
        std::string role = table->GetString(static_cast<int>(line), 8);
        for (char& c : role)
            c = c >= 'a' && c <= 'z' ? static_cast<char>(c - 'a' + 'A') : c;
        if (role.compare(0, 4, "PREP") != 0) {
            expected.push_back(
                TrimBlanks(kestrel::core::fileio::File((*masterNames)[line]).GetBasename()));
        }
    }
    if (expected.empty()) {
        try {
            TOImgSetParser empty(imgset, RadioDifAny, 0);
            FUZZ_EXPECT(!"an image set without scenes was read");
        } catch (const kestrel::ParameterException&) {
        }
        return;
    }
    TOImgSetParser sets(imgset, RadioDifLow, 1);
    FUZZ_EXPECT(sets.GetMfileLines() == expected.size());
    for (unsigned int line = 0; line < sets.GetMfileLines(); ++line) {
        try {
            sets.ParseLine(static_cast<int>(line));
        } catch (const kestrel::DataException&) {
            // a px error that is no integer; the scene identifier, read first, is set
        }
        FUZZ_EXPECT(sets.GetSceneId() == expected[line]);
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const std::string path = FuzzDir::Get().Write("master.txt", data, size);
    try {
        FileListParser list(path);
        Walk(list);
    } catch (const kestrel::Exception&) {
    }
    try {
        auto prep = OpenPrep(path);
        Walk(*prep);
    } catch (const kestrel::Exception&) {
    }
    try {
        TOImgSetParser sets(path, RadioDifModerate, 2);
        Walk(sets);
    } catch (const kestrel::Exception&) {
    }
    try {
        WriteAndReadBack(path);
    } catch (const kestrel::ParameterException&) {
        // "Invalid MFILE" or "Empty text file": nothing to write
    }
    return 0;
}
