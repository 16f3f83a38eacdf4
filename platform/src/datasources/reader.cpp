#include <atomic>
#include <mutex>

#include <kestrel/exception.h>
#include <kestrel/rasterio.h>

#include <kestrel/gdalsupport.h>
#include "channelinfo.h"
#include "gdaldataset.h"
#include "tiling.h"

namespace kestrel {
namespace datasources {

IChannelInfo::~IChannelInfo() = default;
IRasterIterable::~IRasterIterable() = default;
IRasterReader::~IRasterReader() = default;
IRasterWriter::~IRasterWriter() = default;

// ---------------------------------------------------------------------------------------------
// Iterator

namespace {

Window IteratorWindow(IRasterIterable* owner, unsigned int index) {
    auto* reader = dynamic_cast<IRasterReader*>(owner);
    if (reader == nullptr)
        return Window();
    Tiling tiling{reader->GetWidth(), reader->GetHeight(), reader->GetTileWidth(),
                  reader->GetTileHeight()};
    return tiling.Tile(index);
}

}  // namespace

unsigned int RasterIterator::GetX() const {
    return IteratorWindow(owner_, index_).x;
}
unsigned int RasterIterator::GetY() const {
    return IteratorWindow(owner_, index_).y;
}
unsigned int RasterIterator::GetWidth() const {
    return IteratorWindow(owner_, index_).width;
}
unsigned int RasterIterator::GetHeight() const {
    return IteratorWindow(owner_, index_).height;
}

gobs::Raster* RasterIterator::operator*() const {
    if (owner_ == nullptr)
        KESTREL_THROW(DataException, "Dereferencing a raster iterator that belongs to no reader");
    return owner_->GetRaster(index_);
}

// ---------------------------------------------------------------------------------------------
// Observer

namespace {

struct ObserverSlot {
    std::mutex mutex;
    std::shared_ptr<RasterIOObserver> current;
    // Read without the lock on every raster's destruction: most of the time there is none.
    std::atomic<bool> installed{false};
};

ObserverSlot& Slot() {
    static ObserverSlot slot;
    return slot;
}

}  // namespace

RasterIOObserver::~RasterIOObserver() = default;

std::shared_ptr<RasterIOObserver> RasterIOObserver::Install(
    std::shared_ptr<RasterIOObserver> observer) {
    std::lock_guard<std::mutex> lock(Slot().mutex);
    std::swap(Slot().current, observer);
    Slot().installed = Slot().current != nullptr;
    return observer;
}

std::shared_ptr<RasterIOObserver> RasterIOObserver::Current() {
    if (!Slot().installed)
        return nullptr;
    std::lock_guard<std::mutex> lock(Slot().mutex);
    return Slot().current;
}

ScopedRasterIOObserver::ScopedRasterIOObserver(std::shared_ptr<RasterIOObserver> observer)
    : previous_(RasterIOObserver::Install(std::move(observer))) {}

ScopedRasterIOObserver::~ScopedRasterIOObserver() {
    RasterIOObserver::Install(std::move(previous_));
}

// ---------------------------------------------------------------------------------------------
// Reading windows of a GDAL dataset

void CheckWindow(const std::string& path, unsigned int imageWidth, unsigned int imageHeight,
                 unsigned int x, unsigned int y, unsigned int width, unsigned int height,
                 const SourceLocation& where) {
    const unsigned long long right = static_cast<unsigned long long>(x) + width;
    const unsigned long long bottom = static_cast<unsigned long long>(y) + height;
    if (width == 0 || height == 0 || right > imageWidth || bottom > imageHeight) {
        KESTREL_THROW_AT(where, DataException,
                         FormatString("The window of %u x %u pixels at (%u, %u) is not inside "
                                      "the image of %u x %u pixels of %s",
                                      width, height, x, y, imageWidth, imageHeight, path.c_str()));
    }
}

namespace {

// A window that is exactly one whole block of bands of the raster's type is read block by block
// straight into the raster's planes: GDAL's cheapest read. False (having read nothing) for any
// other window; true once tried, GDAL's errors left to the caller's capture.
bool ReadWholeBlocks(GDALDataset& dataset, const std::vector<int>& bands, gobs::Raster& raster,
                     unsigned int x, unsigned int y) {
    int blockWidth = 0;
    int blockHeight = 0;
    for (int b : bands) {
        GDALRasterBand* band = dataset.GetRasterBand(b);
        int w = 0;
        int h = 0;
        band->GetBlockSize(&w, &h);
        if (band->GetRasterDataType() != ToGDAL(raster.GetDataType()) ||
            (blockWidth != 0 && (w != blockWidth || h != blockHeight)))
            return false;
        blockWidth = w;
        blockHeight = h;
    }
    if (blockWidth <= 0 || blockHeight <= 0 || raster.GetWidth() != unsigned(blockWidth) ||
        raster.GetHeight() != unsigned(blockHeight) || x % blockWidth != 0 || y % blockHeight != 0)
        return false;
    for (std::size_t c = 0; c < bands.size(); ++c) {
        if (dataset.GetRasterBand(bands[c])->ReadBlock(
                static_cast<int>(x) / blockWidth, static_cast<int>(y) / blockHeight,
                raster.GetChannelData(static_cast<unsigned int>(c))) != CE_None)
            break;
    }
    return true;
}

}  // namespace

void TransferWindow(GDALDataset& dataset, GDALRWFlag direction, const std::string& path,
                    const std::vector<unsigned int>& channels, gobs::Raster& raster, unsigned int x,
                    unsigned int y, const SourceLocation& where) {
    std::vector<int> bands(channels.begin(), channels.end());
    const GSpacing valueSize = raster.GetValueSize();
    gdalsupport::ErrorCapture errors;
    if (direction == GF_Read && ReadWholeBlocks(dataset, bands, raster, x, y)) {
        if (!errors.Failed())
            return;
        KESTREL_THROW_AT(where, FileAccessException, path, FileAccessException::ReadFailed,
                         FormatString("Could not read the window of %u x %u pixels at (%u, %u) "
                                      "of %s: %s",
                                      raster.GetWidth(), raster.GetHeight(), x, y, path.c_str(),
                                      errors.Reason().c_str()));
    }
    const CPLErr result = dataset.RasterIO(
        direction, static_cast<int>(x), static_cast<int>(y), static_cast<int>(raster.GetWidth()),
        static_cast<int>(raster.GetHeight()), raster.GetData(), static_cast<int>(raster.GetWidth()),
        static_cast<int>(raster.GetHeight()), ToGDAL(raster.GetDataType()),
        static_cast<int>(bands.size()), bands.data(), valueSize,
        valueSize * static_cast<GSpacing>(raster.GetWidth()),
        valueSize * static_cast<GSpacing>(raster.GetPlaneSize()), nullptr);
    if (result != CE_None || errors.Failed()) {
        const bool reading = direction == GF_Read;
        KESTREL_THROW_AT(
            where, FileAccessException, path,
            reading ? FileAccessException::ReadFailed : FileAccessException::WriteFailed,
            FormatString("Could not %s the window of %u x %u pixels at (%u, %u) "
                         "of %s: %s",
                         reading ? "read" : "write", raster.GetWidth(), raster.GetHeight(), x, y,
                         path.c_str(), errors.Reason().c_str()));
    }
}

// ---------------------------------------------------------------------------------------------
// BasicReader

struct BasicReader::Impl {
    std::unique_ptr<IDataset> owned;  // the dataset when the reader owns it
    GdalRasterDataset* dataset = nullptr;
    std::vector<unsigned int> channels;
    DataType type = DataType::Unknown;
    Tiling tiling;
    ChannelInfoList infos;
    std::mutex mutex;  // GDAL datasets serve one thread at a time
};

namespace {

void Initialise(BasicReader::Impl& impl, std::vector<unsigned int> channels,
                const SourceLocation& where) {
    GdalRasterDataset& ds = *impl.dataset;
    const unsigned int count = ds.GetChannelCount();
    if (channels.empty()) {
        for (unsigned int c = 1; c <= count; ++c)
            channels.push_back(c);
    }
    GDALDataType common = GDT_Unknown;
    for (unsigned int c : channels) {
        if (c == 0 || c > count) {
            KESTREL_THROW_AT(where, DataException,
                             FormatString("Channel %u is not a channel of %s, which has %u "
                                          "channels",
                                          c, ds.GetPath().c_str(), count));
        }
        const DataType type = ds.GetDataType(c);
        if (type == DataType::Unknown) {
            KESTREL_THROW_AT(
                where, DataException,
                FormatString("Channel %u of %s has a data type that cannot be read: %s", c,
                             ds.GetPath().c_str(),
                             GDALGetDataTypeName(
                                 ds.GetGDALDataset()->GetRasterBand(int(c))->GetRasterDataType())));
        }
        common = common == GDT_Unknown ? ToGDAL(type) : GDALDataTypeUnion(common, ToGDAL(type));
    }
    impl.type = FromGDAL(common);
    if (impl.type == DataType::Unknown)
        impl.type = DataType::Float64;
    impl.channels = channels;
    impl.tiling.width = ds.GetWidth();
    impl.tiling.height = ds.GetHeight();
    ds.GetBlockSize(channels.front(), impl.tiling.tileWidth, impl.tiling.tileHeight);
    impl.infos.Fill(ds, channels);
}

}  // namespace

BasicReader::BasicReader(const std::string& path) : impl_(std::make_unique<Impl>()) {
    auto dataset = std::make_unique<GdalRasterDataset>(path);
    if (!dataset->IsValid()) {
        VSIStatBufL stat;
        if (path.empty() || VSIStatL(path.c_str(), &stat) != 0) {
            KESTREL_THROW(FileNotFoundException, path,
                          FormatString("No raster file at %s: %s", path.c_str(),
                                       dataset->GetInvalidReason().c_str()));
        }
        KESTREL_THROW(FileAccessException, path, FileAccessException::OpenFailed,
                      FormatString("Could not read %s as a raster: %s", path.c_str(),
                                   dataset->GetInvalidReason().c_str()));
    }
    impl_->dataset = dataset.get();
    impl_->owned = std::move(dataset);
    Initialise(*impl_, {}, KESTREL_HERE);
    if (auto observer = RasterIOObserver::Current())
        observer->ReaderCreated(this, path, impl_->channels);
}

BasicReader::BasicReader(IDataset* dataset, const std::vector<unsigned int>& channels,
                         bool takeOwnership)
    : impl_(std::make_unique<Impl>()) {
    std::unique_ptr<IDataset> given(takeOwnership ? dataset : nullptr);
    if (dataset == nullptr || !dataset->IsValid()) {
        KESTREL_THROW(DataException,
                      FormatString("A raster reader needs a valid dataset%s%s",
                                   dataset != nullptr ? ": " : "",
                                   dataset != nullptr ? dataset->GetPath().c_str() : ""));
    }
    impl_->dataset = dynamic_cast<GdalRasterDataset*>(dataset);
    if (impl_->dataset != nullptr) {
        impl_->owned = std::move(given);
    } else {
        // Another implementation of the interface: read its file through our own dataset.
        auto own = std::make_unique<GdalRasterDataset>(dataset->GetPath());
        if (!own->IsValid()) {
            KESTREL_THROW(
                FileAccessException, dataset->GetPath(), FileAccessException::OpenFailed,
                FormatString("Could not read %s as a raster: %s", dataset->GetPath().c_str(),
                             own->GetInvalidReason().c_str()));
        }
        impl_->dataset = own.get();
        impl_->owned = std::move(own);
    }
    Initialise(*impl_, channels, KESTREL_HERE);
    if (auto observer = RasterIOObserver::Current())
        observer->ReaderCreated(this, dataset->GetPath(), impl_->channels);
}

BasicReader::~BasicReader() = default;

gobs::Raster* BasicReader::ReadWindow(unsigned int x, unsigned int y, unsigned int width,
                                      unsigned int height) {
    CheckWindow(GetPath(), impl_->tiling.width, impl_->tiling.height, x, y, width, height,
                KESTREL_HERE);
    auto raster = std::make_unique<gobs::Raster>(width, height,
                                                 static_cast<unsigned int>(impl_->channels.size()),
                                                 impl_->type, gobs::Raster::Initial::Unset);
    raster->SetOrigin(x, y);
    {
        std::lock_guard<std::mutex> lock(impl_->mutex);
        TransferWindow(*impl_->dataset->GetGDALDataset(), GF_Read, GetPath(), impl_->channels,
                       *raster, x, y, KESTREL_HERE);
    }
    if (auto observer = RasterIOObserver::Current())
        observer->WindowRead(this, x, y, width, height, raster.get());
    return raster.release();
}

gobs::Raster* BasicReader::GetRaster(unsigned int index) {
    if (index >= impl_->tiling.Count()) {
        KESTREL_THROW(DataException, FormatString("Tile %u of %s does not exist: there are %u",
                                                  index, GetPath().c_str(), impl_->tiling.Count()));
    }
    const Window w = impl_->tiling.Tile(index);
    return ReadWindow(w.x, w.y, w.width, w.height);
}

RasterIterator BasicReader::FindRaster(unsigned int x, unsigned int y) {
    return RasterIterator(this, impl_->tiling.Find(x, y));
}
RasterIterator BasicReader::Begin() {
    return RasterIterator(this, 0);
}
RasterIterator BasicReader::End() {
    return RasterIterator(this, impl_->tiling.Count());
}
unsigned int BasicReader::GetTileCount() const {
    return impl_->tiling.Count();
}
void BasicReader::SetOptimalTileSize() {
    impl_->dataset->GetBlockSize(impl_->channels.front(), impl_->tiling.tileWidth,
                                 impl_->tiling.tileHeight);
}
void BasicReader::SetTileSize(unsigned int width, unsigned int height) {
    if (width == 0 || height == 0) {
        KESTREL_THROW(DataException,
                      FormatString("Tile size %u x %u of %s: tiles need at least one pixel", width,
                                   height, GetPath().c_str()));
    }
    impl_->tiling.tileWidth = width;
    impl_->tiling.tileHeight = height;
}
unsigned int BasicReader::GetTileWidth() const {
    return impl_->tiling.tileWidth;
}
unsigned int BasicReader::GetTileHeight() const {
    return impl_->tiling.tileHeight;
}
const std::vector<IChannelInfo*>& BasicReader::GetChannelsInfo() const {
    return impl_->infos.View();
}
std::string BasicReader::GetPath() const {
    return impl_->dataset->GetPath();
}
unsigned int BasicReader::GetWidth() const {
    return impl_->tiling.width;
}
unsigned int BasicReader::GetHeight() const {
    return impl_->tiling.height;
}
unsigned int BasicReader::GetChannelCount() const {
    return static_cast<unsigned int>(impl_->channels.size());
}
std::vector<unsigned int> BasicReader::GetChannels() const {
    return impl_->channels;
}
DataType BasicReader::GetDataType() const {
    return impl_->type;
}
const ogc::cs::ICRS* BasicReader::GetCRS() const {
    return impl_->dataset->GetCRS();
}
const ogc::cs::GeocodingInfo* BasicReader::GetGeocoding() const {
    return impl_->dataset->GetGeocoding();
}
bool BasicReader::GetNoDataValue(unsigned int c, double& value) const {
    if (c >= impl_->channels.size())
        return false;
    return impl_->dataset->GetNoDataValue(impl_->channels[c], value);
}

}  // namespace datasources
}  // namespace kestrel
