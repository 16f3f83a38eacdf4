// Raster data sources: opened datasets.
#pragma once

#include <string>
#include <vector>

#include <kestrel/crs.h>
#include <kestrel/export.h>

namespace kestrel {
namespace datasources {

// Pixel data types, numbered as GDAL numbers them.
enum class DataType : int {
    Unknown = 0,
    Byte = 1,
    UInt16 = 2,
    Int16 = 3,
    UInt32 = 4,
    Int32 = 5,
    Float32 = 6,
    Float64 = 7
};

// An opened dataset.
class KESTREL_API IDataset {
  public:
    virtual ~IDataset();
    IDataset(const IDataset&) = delete;
    IDataset& operator=(const IDataset&) = delete;

    // True when the dataset is usable.
    virtual bool IsValid() const = 0;
    virtual std::string GetPath() const = 0;

  protected:
    IDataset() = default;
};

// A raster dataset. Channels are numbered from 1.
class KESTREL_API IRasterDataset : public IDataset {
  public:
    virtual unsigned int GetWidth() const = 0;
    virtual unsigned int GetHeight() const = 0;
    virtual unsigned int GetChannelCount() const = 0;
    virtual DataType GetDataType(unsigned int channel) const = 0;
    // False when the channel has no no-data value.
    virtual bool GetNoDataValue(unsigned int channel, double& value) const = 0;
    // Null when the dataset has none.
    virtual const ogc::cs::ICRS* GetCRS() const = 0;
    virtual const ogc::cs::GeocodingInfo* GetGeocoding() const = 0;
    // The value of a metadata item in a domain ("" the default, "RPC", ...); empty when absent.
    virtual std::string GetMetadataItem(const std::string& name,
                                        const std::string& domain = "") const = 0;
};

}  // namespace datasources
}  // namespace kestrel
