#include "rasterdem.h"

#include <algorithm>
#include <cstdint>
#include <list>
#include <mutex>
#include <new>
#include <unordered_map>
#include <utility>

#include <cpl_string.h>
#include <cpl_vsi.h>
#include <gdal_priv.h>
#include <gdal_utils.h>

#include <kestrel/exception.h>

#include <kestrel/gdalsupport.h>
#include "griddem.h"
#include "memoryposts.h"

namespace kestrel {
namespace dem {

namespace {

void CloseDataset(GDALDataset* dataset) {
    if (dataset != nullptr)
        GDALClose(dataset);
}

// How the stored values of a band become heights.
struct PostReading {
    GDALRasterBand* band = nullptr;
    GDALRasterBand* mask = nullptr;  // a mask band other than no-data; null when none
    bool hasNoData = false;
    float noData = 0.0f;
    float extraNoData = NAN;
    double offset = 0.0;
    double scale = 1.0;
    std::string name;
};

// Reads the file's own block (blockX, blockY) into heights as Float32, bypassing GDAL's block
// cache: a read through the cache would copy each block twice and keep it in GDAL's memory too.
CPLErr ReadOwnBlock(GDALRasterBand* band, int blockX, int blockY, int width, int height,
                    detail::Heights& heights) {
    int blockWidth = 0, blockHeight = 0;
    band->GetBlockSize(&blockWidth, &blockHeight);
    const GDALDataType type = band->GetRasterDataType();
    const std::size_t full = static_cast<std::size_t>(blockWidth) * blockHeight;
    if (type == GDT_Float32 && width == blockWidth) {
        heights.resize(full);
        const CPLErr result = band->ReadBlock(blockX, blockY, heights.data());
        heights.resize(static_cast<std::size_t>(width) * height);
        return result;
    }
    const int size = GDALGetDataTypeSizeBytes(type);
    std::vector<std::uint8_t> raw(full * static_cast<std::size_t>(size));
    const CPLErr result = band->ReadBlock(blockX, blockY, raw.data());
    heights.resize(static_cast<std::size_t>(width) * height);
    for (int j = 0; j < height; ++j) {
        GDALCopyWords(raw.data() + static_cast<std::size_t>(j) * blockWidth * size, type, size,
                      &heights[static_cast<std::size_t>(j) * width], GDT_Float32, sizeof(float),
                      width);
    }
    return result;
}

// The heights of a window of posts; NaN where a post has none. ownBlock says that the window is
// one of the file's own blocks; storage is memory to reuse for the heights.
std::shared_ptr<detail::PostBlock> ReadPosts(const PostReading& r, int x0, int y0, int width,
                                             int height, bool ownBlock,
                                             detail::Heights storage = {}) {
    auto block = std::make_shared<detail::PostBlock>();
    block->heights = std::move(storage);
    block->width = static_cast<unsigned int>(width);
    block->height = static_cast<unsigned int>(height);
    const std::size_t count = static_cast<std::size_t>(width) * static_cast<std::size_t>(height);
    gdalsupport::ErrorCapture errors;
    CPLErr result = CE_None;
    try {
        if (ownBlock) {
            int blockWidth = 0, blockHeight = 0;
            r.band->GetBlockSize(&blockWidth, &blockHeight);
            result = ReadOwnBlock(r.band, x0 / blockWidth, y0 / blockHeight, width, height,
                                  block->heights);
        } else {
            block->heights.resize(count);
            result = r.band->RasterIO(GF_Read, x0, y0, width, height, block->heights.data(), width,
                                      height, GDT_Float32, 0, 0, nullptr);
            // The posts are held once, in the bounded cache.
            r.band->FlushCache(false);
        }
    } catch (const std::bad_alloc&) {
        KESTREL_THROW(DataException, FormatString("%s: no memory for %d x %d posts", r.name.c_str(),
                                                  width, height));
    }
    if (result != CE_None) {
        KESTREL_THROW(
            DataException,
            FormatString("%s: cannot read the posts from (%d, %d) to (%d, %d): %s", r.name.c_str(),
                         x0, y0, x0 + width, y0 + height, errors.Reason().c_str()));
    }
    std::vector<std::uint8_t> valid;
    if (r.mask != nullptr) {
        valid.resize(count);
        if (r.mask->RasterIO(GF_Read, x0, y0, width, height, valid.data(), width, height, GDT_Byte,
                             0, 0, nullptr) != CE_None) {
            KESTREL_THROW(DataException,
                          FormatString("%s: cannot read the mask of the posts from (%d, %d) to "
                                       "(%d, %d): %s",
                                       r.name.c_str(), x0, y0, x0 + width, y0 + height,
                                       errors.Reason().c_str()));
        }
        r.mask->FlushCache(false);
    }

    float* v = block->heights.data();
    if (r.hasNoData) {
        const float noData = r.noData;
        for (std::size_t i = 0; i < count; ++i)
            v[i] = v[i] == noData ? NAN : v[i];
    }
    if (!std::isnan(r.extraNoData)) {
        const float extra = r.extraNoData;
        for (std::size_t i = 0; i < count; ++i)
            v[i] = v[i] == extra ? NAN : v[i];
    }
    for (std::size_t i = 0; i < valid.size(); ++i)
        v[i] = valid[i] == 0 ? NAN : v[i];
    if (r.offset != 0.0 || r.scale != 1.0) {
        for (std::size_t i = 0; i < count; ++i)
            v[i] = static_cast<float>(r.offset + r.scale * v[i]);
    }
    // An infinite post (or one that the scale made infinite) has no height.
    for (std::size_t i = 0; i < count; ++i)
        v[i] = std::isfinite(v[i]) ? v[i] : NAN;
    return block;
}

// Posts read block by block on demand, the blocks last used kept up to a bound in bytes.
class CachedPosts final : public detail::PostSource {
  public:
    CachedPosts(DatasetPtr dataset, PostReading reading, std::size_t capacity)
        : dataset_(std::move(dataset)), reading_(std::move(reading)), capacity_(capacity) {}

    std::shared_ptr<const detail::PostBlock> GetBlock(unsigned int blockX,
                                                      unsigned int blockY) const override {
        const std::uint64_t key = (static_cast<std::uint64_t>(blockY) << 32) | blockX;
        if (auto block = Find(key))
            return block;
        // GDAL's dataset is read by one thread at a time; a thread that waited may find the
        // block read meanwhile.
        std::lock_guard<std::mutex> reading(readMutex_);
        if (auto block = Find(key))
            return block;
        const int x0 = static_cast<int>(blockX * blockWidth);
        const int y0 = static_cast<int>(blockY * blockHeight);
        std::shared_ptr<detail::PostBlock> block =
            ReadPosts(reading_, x0, y0, static_cast<int>(std::min(blockWidth, width - x0)),
                      static_cast<int>(std::min(blockHeight, height - y0)), ownBlocks, Spare());
        Insert(key, block);
        return block;
    }

  private:
    using Entry = std::pair<std::uint64_t, std::shared_ptr<detail::PostBlock>>;

    std::shared_ptr<const detail::PostBlock> Find(std::uint64_t key) const {
        std::lock_guard<std::mutex> lock(cacheMutex_);
        const auto it = index_.find(key);
        if (it == index_.end())
            return nullptr;
        lru_.splice(lru_.begin(), lru_, it->second);
        return it->second->second;
    }

    // Memory of an evicted block, so that a new block needs no fresh pages.
    detail::Heights Spare() const {
        std::lock_guard<std::mutex> lock(cacheMutex_);
        if (spare_.empty())
            return {};
        detail::Heights storage = std::move(spare_.back());
        spare_.pop_back();
        return storage;
    }

    // The new block is kept even when it alone exceeds the bound. The memory of an evicted
    // block that no query holds any more is kept for the next block read.
    void Insert(std::uint64_t key, std::shared_ptr<detail::PostBlock> block) const {
        std::lock_guard<std::mutex> lock(cacheMutex_);
        held_ += block->heights.size() * sizeof(float);
        lru_.emplace_front(key, std::move(block));
        index_[key] = lru_.begin();
        while (held_ > capacity_ && lru_.size() > 1) {
            std::shared_ptr<detail::PostBlock>& evicted = lru_.back().second;
            held_ -= evicted->heights.size() * sizeof(float);
            if (evicted.use_count() == 1 && spare_.size() < 2)
                spare_.push_back(std::move(evicted->heights));
            index_.erase(lru_.back().first);
            lru_.pop_back();
        }
    }

  public:
    bool ownBlocks = false;  // the cache's blocks are the file's own

  private:
    DatasetPtr dataset_;
    PostReading reading_;
    std::size_t capacity_;
    mutable std::mutex readMutex_;
    mutable std::mutex cacheMutex_;
    mutable std::list<Entry> lru_;
    mutable std::unordered_map<std::uint64_t, std::list<Entry>::iterator> index_;
    mutable std::size_t held_ = 0;
    mutable std::vector<detail::Heights> spare_;
};

void CheckOptions(const std::string& path, const RasterDEMOptions& o) {
    if (!std::isfinite(o.offset) || !std::isfinite(o.scale) || o.scale <= 0.0) {
        KESTREL_THROW(DataException,
                      FormatString("%s: the height offset %g and scale %g must be finite and the "
                                   "scale greater than 0",
                                   path.c_str(), o.offset, o.scale));
    }
    if (o.cacheMegabytes < 1) {
        KESTREL_THROW(DataException,
                      FormatString("%s: the block cache must hold at least 1 megabyte; %d was "
                                   "given",
                                   path.c_str(), o.cacheMegabytes));
    }
}

// The cache's blocks: the file's own blocks when they are of a useful size, otherwise squares of
// 512 posts (rows of strips are read whole by GDAL anyway). True for the file's own blocks.
bool ChooseBlocks(GDALRasterBand* band, unsigned int& blockWidth, unsigned int& blockHeight) {
    int bw = 0, bh = 0;
    band->GetBlockSize(&bw, &bh);
    const long long area = static_cast<long long>(bw) * bh;
    if (area >= 16384 && area <= (4LL << 20)) {
        blockWidth = static_cast<unsigned int>(bw);
        blockHeight = static_cast<unsigned int>(bh);
    } else {
        blockWidth = 512;
        blockHeight = 512;
    }
    const bool own = static_cast<int>(blockWidth) == bw && static_cast<int>(blockHeight) == bh;
    blockWidth = std::min(blockWidth, static_cast<unsigned int>(band->GetXSize()));
    blockHeight = std::min(blockHeight, static_cast<unsigned int>(band->GetYSize()));
    return own;
}

}  // namespace

bool IsDirectory(const std::string& path) {
    VSIStatBufL stat;
    return VSIStatL(path.c_str(), &stat) == 0 && VSI_ISDIR(stat.st_mode);
}

std::vector<std::string> RastersIn(const std::string& directory, std::size_t limit) {
    std::vector<std::string> rasters;
    const CPLStringList listed(VSIReadDir(directory.c_str()));
    std::vector<std::string> names;
    for (int i = 0; i < listed.size(); ++i)
        names.emplace_back(listed[i]);
    std::sort(names.begin(), names.end());
    for (const std::string& name : names) {
        if (limit != 0 && rasters.size() >= limit)
            break;
        if (name == "." || name == "..")
            continue;
        const std::string full = CPLFormFilename(directory.c_str(), name.c_str(), nullptr);
        if (IsDirectory(full))
            continue;
        // A format that holds rasters or vectors (GeoPackage) is identified either way: only
        // a file that opens with a band counts.
        gdalsupport::ErrorCapture quiet;
        if (GDALIdentifyDriverEx(full.c_str(), GDAL_OF_RASTER, nullptr, nullptr) == nullptr)
            continue;
        const DatasetPtr raster(GDALDataset::Open(full.c_str(), GDAL_OF_RASTER | GDAL_OF_READONLY),
                                &CloseDataset);
        if (raster && raster->GetRasterCount() > 0)
            rasters.push_back(full);
    }
    if (rasters.empty()) {
        KESTREL_THROW(FileNotFoundException, directory,
                      FormatString("The DEM directory %s holds no raster that GDAL reads",
                                   directory.c_str()));
    }
    return rasters;
}

DatasetPtr NoDataset() {
    return DatasetPtr(nullptr, &CloseDataset);
}

DatasetPtr BuildMosaic(const std::vector<std::string>& rasters, const std::string& name) {
    gdalsupport::EnsureRegistered();
    gdalsupport::ErrorCapture errors;
    // Where no tile covers the mosaic, a raster without no-data would read as 0: an alpha band
    // marks those places instead.
    bool hasNoData = true;
    {
        DatasetPtr first(
            GDALDataset::Open(rasters.front().c_str(), GDAL_OF_RASTER | GDAL_OF_READONLY),
            &CloseDataset);
        if (!first || first->GetRasterCount() < 1) {
            KESTREL_THROW(FileAccessException, rasters.front(), FileAccessException::OpenFailed,
                          FormatString("%s: GDAL cannot open the raster %s: %s", name.c_str(),
                                       rasters.front().c_str(), errors.Reason().c_str()));
        }
        int has = 0;
        first->GetRasterBand(1)->GetNoDataValue(&has);
        hasNoData = has != 0;
    }
    CPLStringList args;
    args.AddString("-strict");
    if (!hasNoData)
        args.AddString("-addalpha");
    GDALBuildVRTOptions* options = GDALBuildVRTOptionsNew(args.List(), nullptr);
    CPLStringList names;
    for (const auto& r : rasters)
        names.AddString(r.c_str());
    int usageError = 0;
    DatasetPtr mosaic(GDALDataset::FromHandle(GDALBuildVRT("", names.size(), nullptr, names.List(),
                                                           options, &usageError)),
                      &CloseDataset);
    GDALBuildVRTOptionsFree(options);
    if (!mosaic) {
        KESTREL_THROW(DataException,
                      FormatString("%s: GDAL cannot mosaic its %d rasters: %s", name.c_str(),
                                   names.size(), errors.Reason().c_str()));
    }
    return mosaic;
}

std::unique_ptr<IRasterDEM> OpenRasterDEM(const std::string& path,
                                          const RasterDEMOptions& options) {
    gdalsupport::EnsureRegistered();
    CheckOptions(path, options);
    if (IsDirectory(path))
        return MakeRasterDEM(BuildMosaic(RastersIn(path), path), path, options);
    gdalsupport::ErrorCapture errors;
    DatasetPtr dataset(
        GDALDataset::Open(path.c_str(), GDAL_OF_RASTER | GDAL_OF_READONLY | GDAL_OF_VERBOSE_ERROR),
        &CloseDataset);
    if (!dataset) {
        KESTREL_THROW(
            FileAccessException, path, FileAccessException::OpenFailed,
            FormatString("GDAL cannot open the DEM %s: %s", path.c_str(), errors.Reason().c_str()));
    }
    return MakeRasterDEM(std::move(dataset), path, options);
}

std::unique_ptr<IRasterDEM> MakeRasterDEM(DatasetPtr dataset, const std::string& name,
                                          const RasterDEMOptions& options) {
    CheckOptions(name, options);
    const int bands = dataset->GetRasterCount();
    const unsigned int bandNumber = options.band == 0 ? 1 : options.band;
    if (bands < 1 || bandNumber > static_cast<unsigned int>(bands)) {
        KESTREL_THROW(DataException, FormatString("%s has no band %u (it has %d)", name.c_str(),
                                                  bandNumber, bands));
    }
    std::array<double, 6> transform{};
    if (dataset->GetGeoTransform(transform.data()) != CE_None) {
        KESTREL_THROW(DataException,
                      FormatString("%s has no georeferencing (no geotransform)", name.c_str()));
    }
    const ogc::cs::GeocodingInfo geocoding(transform);
    std::unique_ptr<ogc::cs::ICRS> crs;
    if (const OGRSpatialReference* srs = dataset->GetSpatialRef())
        crs = std::make_unique<ogc::cs::ICRS>(*srs);

    PostReading reading;
    reading.band = dataset->GetRasterBand(static_cast<int>(bandNumber));
    int hasNoData = 0;
    const double noData = reading.band->GetNoDataValue(&hasNoData);
    reading.hasNoData = hasNoData != 0;
    reading.noData = static_cast<float>(noData);
    const int maskFlags = reading.band->GetMaskFlags();
    if ((maskFlags & (GMF_ALL_VALID | GMF_NODATA)) == 0)
        reading.mask = reading.band->GetMaskBand();
    reading.extraNoData = options.extraNoData;
    // Heights are delivered in metres: stored values in the unit of the CRS's vertical axis
    // are converted here, whatever datum is asked for later.
    reading.offset = options.offset;
    reading.scale = options.scale * ogc::utils::GetVerticalReference(crs.get()).metresPerUnit;
    reading.name = name;

    const int width = reading.band->GetXSize(), height = reading.band->GetYSize();
    std::unique_ptr<detail::PostSource> posts;
    if (options.preload) {
        posts =
            std::make_unique<detail::MemoryPosts>(ReadPosts(reading, 0, 0, width, height, false));
    } else {
        auto cached = std::make_unique<CachedPosts>(
            std::move(dataset), reading, static_cast<std::size_t>(options.cacheMegabytes) << 20);
        cached->width = static_cast<unsigned int>(width);
        cached->height = static_cast<unsigned int>(height);
        cached->ownBlocks = ChooseBlocks(reading.band, cached->blockWidth, cached->blockHeight);
        posts = std::move(cached);
    }
    return std::make_unique<detail::GridDEM>(std::move(posts), geocoding, std::move(crs),
                                             options.datum, name);
}

}  // namespace dem
}  // namespace kestrel
