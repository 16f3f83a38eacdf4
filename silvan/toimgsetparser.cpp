#include <silvan/toimgsetparser.h>

#include <silvan/filelistparser.h>

#include <string>

namespace kestrel {
namespace processes {
namespace silvan {

namespace {

bool StartsWith(const std::string& text, const char* prefix) {
    return text.compare(0, std::char_traits<char>::length(prefix), prefix) == 0;
}

}  // namespace

TOImgSetParser::TOImgSetParser(const std::string& filename, RadiometricDiff radioDifDefault,
                               int dbmPxErrDefault)
    : MFileParser(0) {
    table = parsercore::ReadTable(*this, filename, mfileLines, KESTREL_HERE);
    AddDefaultLine(radioDifDefault, dbmPxErrDefault);
}

TOImgSetParser::~TOImgSetParser() = default;
TOImgSetParser::TOImgSetParser(const TOImgSetParser&) = default;
TOImgSetParser& TOImgSetParser::operator=(const TOImgSetParser&) = default;

void TOImgSetParser::AddDefaultLine(RadiometricDiff radioDifDefault, int dbmPxErrDefault) {
    table->AddDefaultString("");
    table->AddDefaultString(DecodeRadioDif(radioDifDefault));
    table->AddDefaultInt(dbmPxErrDefault);
}

void TOImgSetParser::ParseLine(int index) {
    parsercore::CheckLineIndex(index, mfileLines, KESTREL_HERE);
    sceneId = table->GetString(index, 0);
    radioDif = EncodeRadioDif(table->GetString(index, 1));
    dbmPxErr = table->GetInt(index, 2);
}

RadiometricDiff TOImgSetParser::EncodeRadioDif(const std::string& text) const {
    if (text.empty())
        return RadioDifAny;
    std::string upper(text);
    for (char& c : upper)
        c = c >= 'a' && c <= 'z' ? static_cast<char>(c - 'a' + 'A') : c;  // as in the "C" locale
    if (StartsWith(upper, "LOW"))
        return RadioDifLow;
    if (StartsWith(upper, "MODERATE"))
        return RadioDifModerate;
    if (StartsWith(upper, "HIGH"))
        return RadioDifHigh;
    return RadioDifAny;
}

std::string TOImgSetParser::DecodeRadioDif(RadiometricDiff value) const {
    switch (value) {
        case RadioDifLow:
            return "LOW";
        case RadioDifModerate:
            return "MODERATE";
        case RadioDifHigh:
            return "HIGH";
        default:
            return "ANY";
    }
}

}  // namespace silvan
}  // namespace processes
}  // namespace kestrel
