#include <kestrel/raster.h>

#include <algorithm>
#include <cmath>
#include <cstring>
#include <limits>

#include <kestrel/exception.h>
#include <kestrel/rasterio.h>

namespace kestrel {
namespace gobs {

namespace {

std::unique_ptr<std::max_align_t[]> Allocate(std::size_t bytes, bool zeros) {
    const std::size_t units = (bytes + sizeof(std::max_align_t) - 1) / sizeof(std::max_align_t);
    std::unique_ptr<std::max_align_t[]> data(new std::max_align_t[units]);
    // Value-initialising the array is not enough: max_align_t holds a long double whose padding
    // bytes the compiler leaves as they were.
    if (zeros)
        std::memset(data.get(), 0, units * sizeof(std::max_align_t));
    return data;
}

template <typename T>
T Convert(double value) {
    if constexpr (std::numeric_limits<T>::is_integer) {
        if (std::isnan(value))
            return 0;
        const double rounded = std::floor(value + 0.5);
        if (rounded <= static_cast<double>(std::numeric_limits<T>::lowest()))
            return std::numeric_limits<T>::lowest();
        if (rounded >= static_cast<double>(std::numeric_limits<T>::max()))
            return std::numeric_limits<T>::max();
        return static_cast<T>(rounded);
    } else {
        return static_cast<T>(value);
    }
}

template <typename F>
auto Dispatch(datasources::DataType type, F&& f) {
    using datasources::DataType;
    switch (type) {
        case DataType::Byte:
            return f(std::uint8_t());
        case DataType::UInt16:
            return f(std::uint16_t());
        case DataType::Int16:
            return f(std::int16_t());
        case DataType::UInt32:
            return f(std::uint32_t());
        case DataType::Int32:
            return f(std::int32_t());
        case DataType::Float32:
            return f(float());
        case DataType::Float64:
        case DataType::Unknown:
            break;
    }
    return f(double());
}

}  // namespace

Raster::Raster(unsigned int width, unsigned int height, unsigned int channels,
               datasources::DataType type, Initial initial)
    : width_(width),
      height_(height),
      channels_(channels),
      type_(type),
      valueSize_(datasources::DataTypeSize(type)) {
    if (valueSize_ == 0 || width == 0 || height == 0 || channels == 0) {
        KESTREL_THROW(
            DataException,
            FormatString("A raster of %u x %u pixels, %u channels and data type %s "
                         "cannot be made",
                         width, height, channels, datasources::DataTypeName(type).c_str()));
    }
    data_ = Allocate(GetByteSize(), initial == Initial::Zeros);
}

Raster::Raster(const Raster& other)
    : width_(other.width_),
      height_(other.height_),
      channels_(other.channels_),
      type_(other.type_),
      valueSize_(other.valueSize_),
      x_(other.x_),
      y_(other.y_),
      data_(Allocate(other.GetByteSize(), false)) {
    std::memcpy(data_.get(), other.data_.get(), GetByteSize());
}

Raster& Raster::operator=(const Raster& other) {
    if (this != &other) {
        Raster copy(other);
        *this = std::move(copy);
    }
    return *this;
}

Raster::Raster(Raster&& other) noexcept = default;
Raster& Raster::operator=(Raster&& other) noexcept = default;

Raster::~Raster() {
    if (auto observer = datasources::RasterIOObserver::Current())
        observer->RasterDeleted(this);
}

void* Raster::GetChannelData(unsigned int c) {
    return const_cast<void*>(static_cast<const Raster*>(this)->GetChannelData(c));
}

const void* Raster::GetChannelData(unsigned int c) const {
    if (c >= channels_) {
        KESTREL_THROW(DataException,
                      FormatString("Channel %u of a raster of %u channels", c, channels_));
    }
    return reinterpret_cast<const unsigned char*>(data_.get()) + GetPlaneSize() * c * valueSize_;
}

std::size_t Raster::Index(unsigned int c, unsigned int x, unsigned int y) const {
    if (c >= channels_ || x >= width_ || y >= height_) {
        KESTREL_THROW(DataException,
                      FormatString("Value (%u, %u) of channel %u is outside a raster of %u x %u "
                                   "pixels and %u channels",
                                   x, y, c, width_, height_, channels_));
    }
    return (static_cast<std::size_t>(c) * height_ + y) * width_ + x;
}

double Raster::GetValue(unsigned int c, unsigned int x, unsigned int y) const {
    const std::size_t index = Index(c, x, y);
    return Dispatch(type_, [&](auto zero) {
        using T = decltype(zero);
        return static_cast<double>(reinterpret_cast<const T*>(data_.get())[index]);
    });
}

void Raster::SetValue(unsigned int c, unsigned int x, unsigned int y, double value) {
    const std::size_t index = Index(c, x, y);
    Dispatch(type_, [&](auto zero) {
        using T = decltype(zero);
        reinterpret_cast<T*>(data_.get())[index] = Convert<T>(value);
        return 0;
    });
}

void Raster::Fill(double value) {
    const std::size_t count = GetPlaneSize() * channels_;
    Dispatch(type_, [&](auto zero) {
        using T = decltype(zero);
        T* data = reinterpret_cast<T*>(data_.get());
        std::fill(data, data + count, Convert<T>(value));
        return 0;
    });
}

}  // namespace gobs
}  // namespace kestrel
