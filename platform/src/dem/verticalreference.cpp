// What a surface model's file says about its heights, and how that meets what the user says.
#include <kestrel/dem.h>
#include <kestrel/elevation.h>

#include <cctype>
#include <cmath>
#include <memory>

#include <cpl_vsi.h>
#include <gdal_priv.h>
#include <ogrsf_frmts.h>

#include <kestrel/exception.h>

#include <kestrel/gdalsupport.h>
#include "heightquery.h"
#include "rasterdem.h"
#include "tileindex.h"

namespace kestrel {
namespace dem {

namespace {

using ogc::utils::VerticalReference;

VerticalReference FromSrs(const OGRSpatialReference* srs) {
    const std::unique_ptr<ogc::cs::ICRS> crs(srs != nullptr ? new ogc::cs::ICRS(*srs) : nullptr);
    return ogc::utils::GetVerticalReference(crs.get());
}

std::string Describe(const VerticalReference& r) {
    return FormatString("\"%s\" (%s, in %s)", r.name.c_str(), detail::DatumName(r.datum).c_str(),
                        r.unit.c_str());
}

}  // namespace

VerticalReference ReadVerticalReference(const std::string& path) {
    gdalsupport::EnsureRegistered();
    VSIStatBufL stat;
    if (path.empty() || VSIStatL(path.c_str(), &stat) != 0)
        KESTREL_THROW(FileNotFoundException, path, FormatString("%s: not found", path.c_str()));
    if (IsDirectory(path))
        return ReadVerticalReference(RastersIn(path, 1).front());
    if (IsTileIndex(path))
        return TileIndexVerticalReference(path);
    gdalsupport::ErrorCapture errors;
    GDALDatasetUniquePtr dataset(GDALDataset::Open(
        path.c_str(), GDAL_OF_RASTER | GDAL_OF_VECTOR | GDAL_OF_READONLY | GDAL_OF_VERBOSE_ERROR));
    if (!dataset) {
        KESTREL_THROW(FileAccessException, path, FileAccessException::OpenFailed,
                      FormatString("%s: GDAL cannot open it as a surface model: %s", path.c_str(),
                                   errors.Reason().c_str()));
    }
    if (dataset->GetRasterCount() > 0)
        return FromSrs(dataset->GetSpatialRef());
    // A TIN: the CRS of its first layer that has one.
    for (int i = 0; i < dataset->GetLayerCount(); ++i) {
        if (const OGRSpatialReference* srs = dataset->GetLayer(i)->GetSpatialRef())
            return FromSrs(srs);
    }
    return VerticalReference();
}

SurfaceHeights ResolveSurfaceHeights(const std::string& path,
                                     const ogc::cs::DatumType* declaredDatum,
                                     const std::string& declaredUnit,
                                     const std::string& datumOrigin,
                                     const std::string& unitOrigin) {
    SurfaceHeights result;
    std::string unit;
    for (char c : declaredUnit)
        unit += static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
    const double declaredScale = unit.empty() ? 1.0 : GetScale(unit);
    result.file = ReadVerticalReference(path);
    const VerticalReference& file = result.file;
    if (!file.known) {
        result.datum = declaredDatum != nullptr ? *declaredDatum : ogc::cs::DatumMSL;
        result.unitScale = declaredScale;
        return result;
    }
    if (declaredDatum != nullptr && *declaredDatum != ogc::cs::DatumMathModel &&
        *declaredDatum != file.datum) {
        KESTREL_THROW(DataException,
                      FormatString("%s: the file says the heights are %s, not %s as %s says; "
                                   "leave %s out to follow the file, or correct the file's CRS "
                                   "(a tile index: its VERTICAL_DATUM item)",
                                   path.c_str(), Describe(file).c_str(),
                                   detail::DatumName(*declaredDatum).c_str(), datumOrigin.c_str(),
                                   datumOrigin.c_str()));
    }
    if (!unit.empty() && std::fabs(declaredScale - file.metresPerUnit) > 1e-9 * declaredScale) {
        KESTREL_THROW(DataException,
                      FormatString("%s: the file says the heights are %s, not in %s as %s says; "
                                   "leave %s out to follow the file, or correct the file's CRS",
                                   path.c_str(), Describe(file).c_str(), declaredUnit.c_str(),
                                   unitOrigin.c_str(), unitOrigin.c_str()));
    }
    result.datum = file.datum;
    result.unitScale = 1.0;
    return result;
}

}  // namespace dem
}  // namespace kestrel
