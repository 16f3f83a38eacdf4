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
    // Why the dataset is not valid (for example GDAL's reason for not opening the file); empty
    // when it is valid or the implementation does not tell.
    virtual std::string GetInvalidReason() const;

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

    // Every item of a metadata domain as "NAME=VALUE" texts, in the dataset's order; empty
    // when the domain is absent. The RPC domain includes coefficients read from side files.
    virtual std::vector<std::string> GetMetadata(const std::string& domain = "") const;
    // The size of the blocks in which the channel is stored (a whole-width strip for untiled
    // files). The default is 256 x 256 clipped to the raster.
    virtual void GetBlockSize(unsigned int channel, unsigned int& width,
                              unsigned int& height) const;
    // The channel's description; empty when it has none.
    virtual std::string GetChannelDescription(unsigned int channel) const;
    // The short name of the format (the GDAL driver name: "GTiff", "VRT", ...); empty when
    // unknown.
    virtual std::string GetFormatName() const;
};

// The number of bytes of one value of a data type (0 for Unknown).
KESTREL_API unsigned int DataTypeSize(DataType type);
// The data type's name as GDAL spells it ("Byte", "UInt16", ..., "Unknown").
KESTREL_API std::string DataTypeName(DataType type);

// Opens any raster GDAL reads, read-only. Never returns null: a path that GDAL cannot open gives
// a dataset whose IsValid is false and whose GetInvalidReason says why. Owned by the caller.
KESTREL_API IRasterDataset* OpenRasterDataset(const std::string& path);

}  // namespace datasources
}  // namespace kestrel
