#include <silvan/utils.h>

#include <memory>

#include <kestrel/stringlist.h>

// ---------------------------------------------------------------------------------------------
// Elevation sources and vertical datums

// (end of elevation sources and vertical datums)

// ---------------------------------------------------------------------------------------------
// Raster access and resampling

// (end of raster access and resampling)

// ---------------------------------------------------------------------------------------------
// Ortho output layout and metadata

// (end of ortho output layout and metadata)

// ---------------------------------------------------------------------------------------------
// Footprint vector output

// (end of footprint vector output)

// ---------------------------------------------------------------------------------------------
// String helpers

std::vector<std::string> TokenizeStr(const std::string& text, const char* delimiters) {
    std::vector<std::string> tokens;
    const std::unique_ptr<char*[], void (*)(char**)> list(TokenizeDelim(text.c_str(), delimiters),
                                                          &DestroyStringList);
    const int count = CountStringList(list.get());
    tokens.reserve(static_cast<std::size_t>(count));
    for (int i = 0; i < count; ++i)
        tokens.push_back(TrimWhitespace(std::string(list[i])));
    return tokens;
}

// ---------------------------------------------------------------------------------------------
// Geometry

ConvexHull2D_DnC::ConvexHull2D_DnC() = default;
ConvexHull2D_DnC::ConvexHull2D_DnC(const ConvexHull2D_DnC&) = default;
ConvexHull2D_DnC::~ConvexHull2D_DnC() = default;
ConvexHull2D_DnC& ConvexHull2D_DnC::operator=(const ConvexHull2D_DnC&) {
    return *this;
}
