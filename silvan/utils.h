// Free functions shared by the true-ortho processes.
#pragma once

#include <string>
#include <vector>

#include <silvan/export.h>

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

// The tokens of text split at each character of delimiters, each trimmed of white space around
// it, in the order in which they stand. A token of blanks only gives an empty element in its
// place; runs of delimiters separate like one, and delimiters at either end give no token.
SILVAN_API std::vector<std::string> TokenizeStr(const std::string& text, const char* delimiters);

// ---------------------------------------------------------------------------------------------
// Geometry

// Divide-and-conquer convex hull of plane points. Kept for the processes that name it; it holds
// nothing and does nothing.
class SILVAN_API ConvexHull2D_DnC {
  public:
    ConvexHull2D_DnC();
    ConvexHull2D_DnC(const ConvexHull2D_DnC&);
    ~ConvexHull2D_DnC();
    ConvexHull2D_DnC& operator=(const ConvexHull2D_DnC&);
};
