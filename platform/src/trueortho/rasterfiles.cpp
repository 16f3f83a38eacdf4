#include "rasterfiles.h"

#include "../gdalsupport.h"

#include <kestrel/exception.h>

#include <cpl_vsi.h>
#include <gdal_priv.h>

#include <array>

namespace kestrel {
namespace processes {
namespace trueortho {

void DatasetCloser::operator()(GDALDataset* ds) const {
    gdalsupport::ErrorCapture errors;
    GDALClose(ds);
}

DatasetPtr OpenRaster(const std::string& path, const char* role) {
    gdalsupport::EnsureRegistered();
    gdalsupport::ErrorCapture errors;
    VSIStatBufL stat;
    if (VSIStatL(path.c_str(), &stat) != 0)
        KESTREL_THROW(FileNotFoundException, path,
                      FormatString("The %s \"%s\" does not exist", role, path.c_str()));
    DatasetPtr ds(GDALDataset::Open(path.c_str(), GDAL_OF_RASTER | GDAL_OF_READONLY));
    if (!ds)
        KESTREL_THROW(DataException, FormatString("The %s \"%s\" cannot be read as a raster: %s",
                                                  role, path.c_str(), errors.Reason().c_str()));
    return ds;
}

void ReadWindow(GDALDataset& ds, const std::string& path, const std::vector<int>& bands, int x,
                int y, int width, int height, float* buffer) {
    // Only the part inside the raster is read.
    const int x0 = std::max(x, 0), y0 = std::max(y, 0);
    const int x1 = std::min(x + width, ds.GetRasterXSize());
    const int y1 = std::min(y + height, ds.GetRasterYSize());
    if (x1 <= x0 || y1 <= y0)
        return;
    gdalsupport::ErrorCapture errors;
    const GSpacing pixel = sizeof(float), line = pixel * width, band = line * height;
    float* start = buffer + (y0 - y) * static_cast<std::ptrdiff_t>(width) + (x0 - x);
    if (ds.RasterIO(GF_Read, x0, y0, x1 - x0, y1 - y0, start, x1 - x0, y1 - y0, GDT_Float32,
                    static_cast<int>(bands.size()), const_cast<int*>(bands.data()), pixel, line,
                    band, nullptr) != CE_None)
        KESTREL_THROW(
            FileAccessException, path, FileAccessException::ReadFailed,
            FormatString("Reading %s at pixel %d, line %d (%d x %d) failed: %s", path.c_str(), x0,
                         y0, x1 - x0, y1 - y0, errors.Reason().c_str()));
}

void RemoveRaster(const std::string& path) {
    gdalsupport::ErrorCapture errors;
    VSIStatBufL stat;
    if (VSIStatL(path.c_str(), &stat) != 0)
        return;
    if (GDALDriverH driver = GDALIdentifyDriver(path.c_str(), nullptr))
        if (GDALDeleteDataset(driver, path.c_str()) == CE_None)
            return;
    VSIUnlink(path.c_str());
}

OutputRaster::OutputRaster(const std::string& path, const std::string& format, unsigned int pixels,
                           unsigned int lines, int bands, int gdalType, const ogc::cs::ICRS* crs,
                           const ogc::cs::GeocodingInfo& geocoding, double noData)
    : path_(path), temporary_(path + ".partial") {
    gdalsupport::EnsureRegistered();
    gdalsupport::ErrorCapture errors;
    GDALDriver* driver = GetGDALDriverManager()->GetDriverByName(format.c_str());
    if (driver == nullptr || driver->GetMetadataItem(GDAL_DCAP_CREATE) == nullptr)
        KESTREL_THROW(DataException,
                      FormatString("Output %s: \"%s\" is not a GDAL driver that creates files",
                                   path.c_str(), format.c_str()));
    RemoveRaster(temporary_);
    CPLStringList options;
    if (format == "GTiff") {
        options.AddString("TILED=YES");
        options.AddString("BIGTIFF=IF_SAFER");
        options.AddString(bands > 1 ? "INTERLEAVE=PIXEL" : "INTERLEAVE=BAND");
    }
    ds_.reset(driver->Create(temporary_.c_str(), static_cast<int>(pixels), static_cast<int>(lines),
                             bands, static_cast<GDALDataType>(gdalType), options.List()));
    if (!ds_)
        KESTREL_THROW(
            FileAccessException, path, FileAccessException::CreateFailed,
            FormatString("Cannot create %s: %s", temporary_.c_str(), errors.Reason().c_str()));
    std::array<double, 6> gt = geocoding.GetGeoTransform();
    ds_->SetGeoTransform(gt.data());
    if (crs != nullptr)
        ds_->SetSpatialRef(&crs->GetSpatialReference());
    for (int b = 1; b <= bands; ++b)
        ds_->GetRasterBand(b)->SetNoDataValue(noData);
}

OutputRaster::~OutputRaster() {
    if (ds_)
        Discard();
}

void OutputRaster::Write(int x, int y, int width, int height, const float* buffer) {
    std::lock_guard<std::mutex> lock(mutex_);
    gdalsupport::ErrorCapture errors;
    const GSpacing pixel = sizeof(float), line = pixel * width, band = line * height;
    if (ds_->RasterIO(GF_Write, x, y, width, height, const_cast<float*>(buffer), width, height,
                      GDT_Float32, ds_->GetRasterCount(), nullptr, pixel, line, band,
                      nullptr) != CE_None ||
        // Written blocks go to the file at once rather than waiting in GDAL's cache, so that
        // memory stays that of the tiles in hand whatever the output's size.
        (ds_->FlushCache(false), errors.Failed()))
        KESTREL_THROW(
            FileAccessException, path_, FileAccessException::WriteFailed,
            FormatString("Writing %s failed: %s", temporary_.c_str(), errors.Reason().c_str()));
}

void OutputRaster::SetMetadataItem(const std::string& name, const std::string& value) {
    std::lock_guard<std::mutex> lock(mutex_);
    ds_->SetMetadataItem(name.c_str(), value.c_str());
}

void OutputRaster::Commit() {
    std::lock_guard<std::mutex> lock(mutex_);
    gdalsupport::ErrorCapture errors;
    GDALDataset* ds = ds_.release();
    ds->FlushCache(true);
    GDALClose(ds);
    const bool closed = !errors.Failed();
    if (!closed) {
        RemoveRaster(temporary_);
        KESTREL_THROW(
            FileAccessException, path_, FileAccessException::WriteFailed,
            FormatString("Writing %s failed: %s", temporary_.c_str(), errors.Reason().c_str()));
    }
    RemoveRaster(path_);
    if (VSIRename(temporary_.c_str(), path_.c_str()) != 0) {
        RemoveRaster(temporary_);
        KESTREL_THROW(FileAccessException, path_, FileAccessException::WriteFailed,
                      FormatString("Cannot rename %s to %s", temporary_.c_str(), path_.c_str()));
    }
}

void OutputRaster::Discard() {
    ds_.reset();
    RemoveRaster(temporary_);
}

}  // namespace trueortho
}  // namespace processes
}  // namespace kestrel
