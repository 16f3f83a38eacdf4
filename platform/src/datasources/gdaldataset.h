// The raster dataset on a GDAL dataset, shared by the readers, writers and channel groups.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include <gdal_priv.h>

#include <kestrel/crs.h>
#include <kestrel/datasources.h>

namespace kestrel {
namespace datasources {

// Closes a GDAL dataset.
struct GDALDatasetCloser {
    void operator()(GDALDataset* dataset) const;
};
using GDALDatasetPtr = std::unique_ptr<GDALDataset, GDALDatasetCloser>;

// Maps our data types to GDAL's and back (GDAL types we do not know give Unknown).
GDALDataType ToGDAL(DataType type);
DataType FromGDAL(GDALDataType type);

// A raster dataset opened read-only through GDAL.
class GdalRasterDataset : public IRasterDataset {
  public:
    // Opens the path; never throws for a file GDAL cannot open (IsValid is then false).
    explicit GdalRasterDataset(const std::string& path);
    ~GdalRasterDataset() override;

    bool IsValid() const override { return dataset_ != nullptr; }
    std::string GetPath() const override { return path_; }
    std::string GetInvalidReason() const override { return reason_; }

    unsigned int GetWidth() const override;
    unsigned int GetHeight() const override;
    unsigned int GetChannelCount() const override;
    DataType GetDataType(unsigned int channel) const override;
    bool GetNoDataValue(unsigned int channel, double& value) const override;
    const ogc::cs::ICRS* GetCRS() const override { return crs_.get(); }
    const ogc::cs::GeocodingInfo* GetGeocoding() const override { return geocoding_.get(); }
    std::string GetMetadataItem(const std::string& name, const std::string& domain) const override;
    std::vector<std::string> GetMetadata(const std::string& domain) const override;
    void GetBlockSize(unsigned int channel, unsigned int& width,
                      unsigned int& height) const override;
    std::string GetChannelDescription(unsigned int channel) const override;
    std::string GetFormatName() const override;

    // The GDAL dataset (null when not valid). Not thread-safe: GDAL datasets are used by one
    // thread at a time.
    GDALDataset* GetGDALDataset() const { return dataset_.get(); }

  private:
    GDALRasterBand* Band(unsigned int channel) const;

    std::string path_;
    std::string reason_;
    GDALDatasetPtr dataset_;
    std::unique_ptr<ogc::cs::ICRS> crs_;
    std::unique_ptr<ogc::cs::GeocodingInfo> geocoding_;
};

// CRS and geocoding of an open GDAL dataset: null where it has none (a geotransform that GDAL
// only defaults, or one that cannot be inverted, counts as none).
std::unique_ptr<ogc::cs::ICRS> ReadCRS(GDALDataset& dataset);
std::unique_ptr<ogc::cs::GeocodingInfo> ReadGeocoding(GDALDataset& dataset);

}  // namespace datasources
}  // namespace kestrel
