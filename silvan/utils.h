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

#include <kestrel/datasources.h>
#include <kestrel/rasterio.h>
#include <kestrel/resampler.h>

// Every function returns a new object owned by the caller. Failures are kestrel exceptions;
// those of the raster components pass through unchanged.

// The dataset of a raster file. Throws FileNotFoundException (file name = the path, empty
// message) when the file cannot be opened as a raster.
SILVAN_API kestrel::datasources::IDataset* GetRasterDataset(const std::string& path);

// A reader on every channel of a raster file, checked by reading its first pixel.
SILVAN_API kestrel::datasources::IRasterReader* GetRasterReader(const std::string& path);

// A reader on the given channels of an open dataset (which the caller keeps and deletes after
// the reader), checked by reading its first pixel.
SILVAN_API kestrel::datasources::IRasterReader* GetRasterReader(
    kestrel::datasources::IDataset* dataset, const std::vector<unsigned int>& channels);

// A writer on a raster file (see BasicWriter(const std::string&)).
SILVAN_API kestrel::datasources::IRasterWriter* GetRasterWriter(const std::string& path);

// A writer of a new raster file in the format that the file type names ("tif", "cog", "gpkg",
// ...; see kestrel::core::FType2FormatName), one channel per entry of channels.
SILVAN_API kestrel::datasources::IRasterWriter* GetRasterWriter(
    const std::string& path, const std::string& fileType,
    const std::vector<unsigned int>& channels);

// The source and ortho channel lists of channels, which must all have one data type (an empty
// list means every channel of the dataset). Throws DataException naming the number of data
// types when they do not; the two lists are then left as they were.
SILVAN_API void GetSrcOrthoChans(kestrel::datasources::IDataset* dataset,
                                 std::vector<unsigned int> channels,
                                 std::vector<unsigned int>& srcChans,
                                 std::vector<unsigned int>& orthoChans);

// The resampler of a method by GDAL's name ("near", "bilinear", "cubic", "cubicspline",
// "lanczos", "average", "mode"; case-blind). Throws ParameterException type 1 whose parameter
// name is the method text for a method it does not know; method is left unchanged.
SILVAN_API kestrel::utils::IRasterResampler* GetResampler(std::string& method);

// The device number of the disk that holds the file; 0 when the path cannot be examined.
SILVAN_API unsigned int GetDiskId(const std::string& path);

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
