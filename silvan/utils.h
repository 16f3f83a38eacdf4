// Free functions shared by the true-ortho processes.
#pragma once

#include <string>
#include <vector>

#include <silvan/export.h>

// ---------------------------------------------------------------------------------------------
// Elevation sources and vertical datums

#include <kestrel/crs.h>
#include <kestrel/dem.h>
#include <kestrel/mathmodel.h>
#include <kestrel/tin.h>

// The DEM at demPath: a tiled DEM, a raster file or a directory of rasters. band, offset, scale
// and noData are handed to DEMFactory::CreateFileRasterDEM (docs/elevation.md). demDatum is the
// datum of a file DEM's heights; for a tiled DEM it is replaced by the tiled DEM's own. The
// DEM delivers heights in outDatum, or in the math model's datum when its own is that one.
SILVAN_API kestrel::dem::IRasterDEM* GetDem(const std::string& demPath, int band, double offset,
                                            double scale, float noData,
                                            kestrel::ogc::cs::DatumType& demDatum,
                                            kestrel::ogc::cs::DatumType outDatum);

// A DEM of one height over the grid of lines x pixels that crs and geocoding describe.
SILVAN_API kestrel::dem::IRasterDEM* GetConstantDem(const kestrel::ogc::cs::ICRS* crs,
                                                    const kestrel::ogc::cs::GeocodingInfo* geocoding,
                                                    unsigned int lines, unsigned int pixels,
                                                    double height,
                                                    kestrel::ogc::cs::DatumType demDatum,
                                                    kestrel::ogc::cs::DatumType outDatum);

// A reader of the TIN surface model at dbmPath, or null when the path is empty or names no TIN.
SILVAN_API kestrel::tin::TinReader* GetDbm(const std::string& dbmPath, int layer, double offset,
                                           double scale, kestrel::ogc::cs::DatumType dbmDatum,
                                           kestrel::ogc::cs::DatumType outDatum);

// The datum an -elevref keyword names: empty or MSL, ELL... (ELLIPS), MATHMODEL, in any case.
SILVAN_API kestrel::ogc::cs::DatumType GetVertDatum(const std::string& keyword);

// The vertical datum of a math model's coordinate system; the ellipsoid for a null model.
SILVAN_API kestrel::ogc::cs::DatumType GetModelDatum(const kestrel::mathmodel::IMathModel* model);

// Offset (default 0) and scale (default 1) from the -elfactor list of at most two elements.
SILVAN_API void GetElFactor(const std::vector<float>& factors, double& offset, double& scale);

// Multiplies scale by the factor that takes heights in units into metres.
SILVAN_API void GetElUnits(const std::string& units, double& scale);

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
