#include "gdaldataset.h"

#include <algorithm>
#include <array>

#include <cpl_string.h>

#include <kestrel/exception.h>

#include <kestrel/gdalsupport.h>

namespace kestrel {
namespace datasources {

// Defaults of the interface's optional operations.
std::string IDataset::GetInvalidReason() const {
    return "";
}

std::vector<std::string> IRasterDataset::GetMetadata(const std::string& /*domain*/) const {
    return {};
}

void IRasterDataset::GetBlockSize(unsigned int /*channel*/, unsigned int& width,
                                  unsigned int& height) const {
    width = std::min(256u, std::max(1u, GetWidth()));
    height = std::min(256u, std::max(1u, GetHeight()));
}

std::string IRasterDataset::GetChannelDescription(unsigned int /*channel*/) const {
    return "";
}

std::string IRasterDataset::GetFormatName() const {
    return "";
}

unsigned int DataTypeSize(DataType type) {
    switch (type) {
        case DataType::Byte:
            return 1;
        case DataType::UInt16:
        case DataType::Int16:
            return 2;
        case DataType::UInt32:
        case DataType::Int32:
        case DataType::Float32:
            return 4;
        case DataType::Float64:
            return 8;
        case DataType::Unknown:
            break;
    }
    return 0;
}

std::string DataTypeName(DataType type) {
    return GDALGetDataTypeName(ToGDAL(type));
}

void GDALDatasetCloser::operator()(GDALDataset* dataset) const {
    gdalsupport::ErrorCapture errors;
    GDALClose(GDALDataset::ToHandle(dataset));
}

GDALDataType ToGDAL(DataType type) {
    switch (type) {
        case DataType::Byte:
            return GDT_Byte;
        case DataType::UInt16:
            return GDT_UInt16;
        case DataType::Int16:
            return GDT_Int16;
        case DataType::UInt32:
            return GDT_UInt32;
        case DataType::Int32:
            return GDT_Int32;
        case DataType::Float32:
            return GDT_Float32;
        case DataType::Float64:
            return GDT_Float64;
        case DataType::Unknown:
            break;
    }
    return GDT_Unknown;
}

DataType FromGDAL(GDALDataType type) {
    switch (type) {
        case GDT_Byte:
            return DataType::Byte;
        case GDT_UInt16:
            return DataType::UInt16;
        case GDT_Int16:
            return DataType::Int16;
        case GDT_UInt32:
            return DataType::UInt32;
        case GDT_Int32:
            return DataType::Int32;
        case GDT_Float32:
            return DataType::Float32;
        case GDT_Float64:
            return DataType::Float64;
        default:
            return DataType::Unknown;
    }
}

std::unique_ptr<ogc::cs::ICRS> ReadCRS(GDALDataset& dataset) {
    const OGRSpatialReference* srs = dataset.GetSpatialRef();
    if (srs == nullptr || srs->IsEmpty())
        return nullptr;
    return std::make_unique<ogc::cs::ICRS>(*srs);
}

std::unique_ptr<ogc::cs::GeocodingInfo> ReadGeocoding(GDALDataset& dataset) {
    std::array<double, 6> transform{};
    gdalsupport::ErrorCapture errors;
    if (dataset.GetGeoTransform(transform.data()) != CE_None)
        return nullptr;
    try {
        return std::make_unique<ogc::cs::GeocodingInfo>(transform);
    } catch (const DataException&) {
        return nullptr;  // not invertible: no usable geocoding
    }
}

GdalRasterDataset::GdalRasterDataset(const std::string& path) : path_(path) {
    gdalsupport::EnsureRegistered();
    gdalsupport::ErrorCapture errors;
    if (path.empty() || path.find('\0') != std::string::npos) {
        reason_ = "empty or malformed path";
        return;
    }
    dataset_.reset(
        GDALDataset::Open(path.c_str(), GDAL_OF_RASTER | GDAL_OF_READONLY | GDAL_OF_VERBOSE_ERROR));
    if (dataset_ == nullptr) {
        reason_ = errors.Reason();
        return;
    }
    if (dataset_->GetRasterCount() == 0 || dataset_->GetRasterXSize() <= 0 ||
        dataset_->GetRasterYSize() <= 0) {
        reason_ = "the file holds no raster channels";
        dataset_.reset();
        return;
    }
    crs_ = ReadCRS(*dataset_);
    geocoding_ = ReadGeocoding(*dataset_);
}

GdalRasterDataset::~GdalRasterDataset() = default;

GDALRasterBand* GdalRasterDataset::Band(unsigned int channel) const {
    if (dataset_ == nullptr || channel == 0 ||
        channel > static_cast<unsigned int>(dataset_->GetRasterCount()))
        return nullptr;
    return dataset_->GetRasterBand(static_cast<int>(channel));
}

unsigned int GdalRasterDataset::GetWidth() const {
    return dataset_ ? static_cast<unsigned int>(dataset_->GetRasterXSize()) : 0u;
}

unsigned int GdalRasterDataset::GetHeight() const {
    return dataset_ ? static_cast<unsigned int>(dataset_->GetRasterYSize()) : 0u;
}

unsigned int GdalRasterDataset::GetChannelCount() const {
    return dataset_ ? static_cast<unsigned int>(dataset_->GetRasterCount()) : 0u;
}

DataType GdalRasterDataset::GetDataType(unsigned int channel) const {
    GDALRasterBand* band = Band(channel);
    return band != nullptr ? FromGDAL(band->GetRasterDataType()) : DataType::Unknown;
}

bool GdalRasterDataset::GetNoDataValue(unsigned int channel, double& value) const {
    GDALRasterBand* band = Band(channel);
    if (band == nullptr)
        return false;
    int has = 0;
    const double v = band->GetNoDataValue(&has);
    if (has == 0)
        return false;
    value = v;
    return true;
}

std::string GdalRasterDataset::GetMetadataItem(const std::string& name,
                                               const std::string& domain) const {
    if (dataset_ == nullptr)
        return "";
    gdalsupport::ErrorCapture errors;
    const char* value = dataset_->GetMetadataItem(name.c_str(), domain.c_str());
    return value != nullptr ? value : "";
}

std::vector<std::string> GdalRasterDataset::GetMetadata(const std::string& domain) const {
    std::vector<std::string> items;
    if (dataset_ == nullptr)
        return items;
    gdalsupport::ErrorCapture errors;
    for (char** item = dataset_->GetMetadata(domain.c_str()); item != nullptr && *item != nullptr;
         ++item)
        items.emplace_back(*item);
    return items;
}

void GdalRasterDataset::GetBlockSize(unsigned int channel, unsigned int& width,
                                     unsigned int& height) const {
    GDALRasterBand* band = Band(channel);
    if (band == nullptr) {
        IRasterDataset::GetBlockSize(channel, width, height);
        return;
    }
    int w = 0;
    int h = 0;
    band->GetBlockSize(&w, &h);
    width = static_cast<unsigned int>(std::max(1, w));
    height = static_cast<unsigned int>(std::max(1, h));
}

std::string GdalRasterDataset::GetChannelDescription(unsigned int channel) const {
    GDALRasterBand* band = Band(channel);
    return band != nullptr ? band->GetDescription() : "";
}

std::string GdalRasterDataset::GetFormatName() const {
    if (dataset_ == nullptr || dataset_->GetDriver() == nullptr)
        return "";
    return dataset_->GetDriver()->GetDescription();
}

IRasterDataset* OpenRasterDataset(const std::string& path) {
    return new GdalRasterDataset(path);
}

}  // namespace datasources
}  // namespace kestrel
