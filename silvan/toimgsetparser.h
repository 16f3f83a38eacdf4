// The image-set file of the gap-filling process: scene identifier, level of radiometric
// difference and DBM pixel error per line.
#pragma once

#include <cstdint>
#include <memory>
#include <string>

#include <kestrel/mfileparser.h>
#include <silvan/export.h>
#include <silvan/filelistparser.h>

// Level of radiometric difference between a scene and its neighbours. Its text forms are "ANY",
// "LOW", "MODERATE" and "HIGH".
enum RadiometricDiff : std::int32_t {
    RadioDifAny = 0,
    RadioDifLow = 1,
    RadioDifModerate = 2,
    RadioDifHigh = 3
};

namespace kestrel {
namespace processes {
namespace silvan {

class SILVAN_API TOImgSetParser : public MFileParser {
  public:
    // radioDif and dbmPxErr are the values of a line that leaves columns 1 and 2 out or empty.
    TOImgSetParser(const std::string& filename, RadiometricDiff radioDif, int dbmPxErr);
    ~TOImgSetParser() override;
    // A copy has its own table, which shares the file's bytes with the original.
    TOImgSetParser(const TOImgSetParser&);
    TOImgSetParser& operator=(const TOImgSetParser&);

    // Makes the line with this index (from 0) the current line.
    void ParseLine(int index);

    std::string GetSceneId() const { return sceneId; }
    RadiometricDiff GetRadioDif() const { return radioDif; }
    int GetDbmPxErr() const { return dbmPxErr; }
    unsigned int GetMfileLines() const { return mfileLines; }

  private:
    void AddDefaultLine(RadiometricDiff radioDifDefault, int dbmPxErrDefault);
    // Text to level: a case-blind prefix match of "LOW", "MODERATE" or "HIGH" at the start of
    // the text; anything else, the empty text included, is RadioDifAny.
    RadiometricDiff EncodeRadioDif(const std::string& text) const;
    // Level to text; a value outside the enumeration gives "ANY".
    std::string DecodeRadioDif(RadiometricDiff value) const;

    std::string sceneId;
    RadiometricDiff radioDif = RadioDifAny;
    int dbmPxErr = 0;
    unsigned int mfileLines = 0;
    parsercore::OwnedTable table;
};

}  // namespace silvan
}  // namespace processes
}  // namespace kestrel
