// Channel descriptions of readers and writers, and the window transfer they share.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include <gdal_priv.h>

#include <kestrel/datasources.h>
#include <kestrel/exception.h>
#include <kestrel/rasterio.h>

namespace kestrel {
namespace datasources {

class ChannelInfo : public IChannelInfo {
  public:
    ChannelInfo(unsigned int channel, DataType type, bool hasNoData, double noData,
                std::string description)
        : channel_(channel),
          type_(type),
          hasNoData_(hasNoData),
          noData_(noData),
          description_(std::move(description)) {}
    unsigned int GetChannel() const override { return channel_; }
    DataType GetDataType() const override { return type_; }
    bool GetNoDataValue(double& value) const override {
        if (hasNoData_)
            value = noData_;
        return hasNoData_;
    }
    std::string GetDescription() const override { return description_; }

  private:
    unsigned int channel_;
    DataType type_;
    bool hasNoData_;
    double noData_;
    std::string description_;
};

// Owns the entries and shows them as the interface's list of pointers.
class ChannelInfoList {
  public:
    void Fill(const IRasterDataset& dataset, const std::vector<unsigned int>& channels) {
        Clear();
        for (unsigned int c : channels) {
            double noData = 0.0;
            const bool has = dataset.GetNoDataValue(c, noData);
            Add(std::make_unique<ChannelInfo>(c, dataset.GetDataType(c), has, noData,
                                              dataset.GetChannelDescription(c)));
        }
    }
    void Add(std::unique_ptr<ChannelInfo> info) {
        view_.push_back(info.get());
        owned_.push_back(std::move(info));
    }
    void Clear() {
        view_.clear();
        owned_.clear();
    }
    const std::vector<IChannelInfo*>& View() const { return view_; }

  private:
    std::vector<std::unique_ptr<ChannelInfo>> owned_;
    std::vector<IChannelInfo*> view_;
};

// Throws DataException unless the window lies inside the image and is not empty.
void CheckWindow(const std::string& path, unsigned int imageWidth, unsigned int imageHeight,
                 unsigned int x, unsigned int y, unsigned int width, unsigned int height,
                 const SourceLocation& where);

// Reads or writes the raster's channels as the dataset's bands `channels` at (x, y); throws
// FileAccessException with GDAL's reason on failure.
void TransferWindow(GDALDataset& dataset, GDALRWFlag direction, const std::string& path,
                    const std::vector<unsigned int>& channels, gobs::Raster& raster, unsigned int x,
                    unsigned int y, const SourceLocation& where);

}  // namespace datasources
}  // namespace kestrel
