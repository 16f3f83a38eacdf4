// A block of raster data in memory: a window of some channels of an image.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>

#include <kestrel/datasources.h>
#include <kestrel/export.h>

namespace kestrel {
namespace gobs {

// Width x height pixels of one or more channels of one data type, in one contiguous buffer.
//
// Layout: band-sequential. The value of channel c (0-based position in the raster, not the
// dataset's channel number), line y, pixel x is the element (c * height + y) * width + x of the
// buffer, in the machine's byte order. Each channel is a plane of width * height values.
//
// A raster also records the window it holds: its origin (x, y) in the full image, so that a
// raster read from a window can be resampled and written back by image coordinates.
class KESTREL_API Raster {
  public:
    // What a new raster's buffer holds: zeros, or nothing yet (for a caller that sets every
    // value, such as a read).
    enum class Initial { Zeros, Unset };

    // Throws DataException for DataType::Unknown, a zero size or zero channels.
    Raster(unsigned int width, unsigned int height, unsigned int channels,
           datasources::DataType type, Initial initial = Initial::Zeros);
    Raster(const Raster& other);
    Raster& operator=(const Raster& other);
    Raster(Raster&& other) noexcept;
    Raster& operator=(Raster&& other) noexcept;
    ~Raster();

    unsigned int GetWidth() const { return width_; }
    unsigned int GetHeight() const { return height_; }
    unsigned int GetChannelCount() const { return channels_; }
    datasources::DataType GetDataType() const { return type_; }
    // Bytes of one value.
    unsigned int GetValueSize() const { return valueSize_; }
    // Values in one channel plane: width * height.
    std::size_t GetPlaneSize() const {
        return static_cast<std::size_t>(width_) * static_cast<std::size_t>(height_);
    }
    // Bytes of the whole buffer.
    std::size_t GetByteSize() const { return GetPlaneSize() * channels_ * valueSize_; }

    // The window's origin in the full image (0, 0 unless set).
    unsigned int GetX() const { return x_; }
    unsigned int GetY() const { return y_; }
    void SetOrigin(unsigned int x, unsigned int y) {
        x_ = x;
        y_ = y;
    }

    // The buffer (see the layout above), aligned for any data type.
    void* GetData() { return data_.get(); }
    const void* GetData() const { return data_.get(); }
    // The first value of channel c's plane. Throws DataException when c is out of range.
    void* GetChannelData(unsigned int c);
    const void* GetChannelData(unsigned int c) const;

    // One value as a double, for tests and slow paths; (x, y) in the raster's own pixels.
    // Throws DataException when out of range.
    double GetValue(unsigned int c, unsigned int x, unsigned int y) const;
    // Stores a value converted to the raster's type (rounded and clamped for integer types).
    void SetValue(unsigned int c, unsigned int x, unsigned int y, double value);
    // Sets every value of every channel.
    void Fill(double value);

  private:
    std::size_t Index(unsigned int c, unsigned int x, unsigned int y) const;

    unsigned int width_;
    unsigned int height_;
    unsigned int channels_;
    datasources::DataType type_;
    unsigned int valueSize_;
    unsigned int x_ = 0;
    unsigned int y_ = 0;
    std::unique_ptr<std::max_align_t[]> data_;
};

}  // namespace gobs
}  // namespace kestrel
