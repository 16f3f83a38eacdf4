#include <algorithm>
#include <array>
#include <cerrno>
#include <cmath>
#include <mutex>
#include <optional>
#include <random>

#include <cpl_string.h>
#include <cpl_vsi.h>

#include <kestrel/exception.h>
#include <kestrel/formats.h>
#include <kestrel/rasterio.h>

#include <kestrel/gdalsupport.h>
#include "channelinfo.h"
#include "gdaldataset.h"
#include "tiling.h"

#if defined(_WIN32)
#define WIN32_LEAN_AND_MEAN
#include <windows.h>
#endif

namespace kestrel {
namespace datasources {

namespace {

struct MetadataItem {
    std::string name;
    std::string value;
    std::string domain;
};

struct PathParts {
    std::string dir;   // with its trailing separator, or empty
    std::string stem;  // base name without the extension
    std::string ext;   // with its dot, or empty
};

PathParts Split(const std::string& path) {
    PathParts parts;
    const std::size_t slash = path.find_last_of("/\\");
    const std::size_t start = slash == std::string::npos ? 0 : slash + 1;
    parts.dir = path.substr(0, start);
    const std::string base = path.substr(start);
    const std::size_t dot = base.find_last_of('.');
    if (dot == std::string::npos || dot == 0) {
        parts.stem = base;
    } else {
        parts.stem = base.substr(0, dot);
        parts.ext = base.substr(dot);
    }
    return parts;
}

std::string RandomTag() {
    static const char digits[] = "abcdefghijklmnopqrstuvwxyz0123456789";
    std::random_device device;
    std::string tag;
    for (int i = 0; i < 8; ++i)
        tag += digits[device() % 36];
    return tag;
}

bool Exists(const std::string& path) {
    VSIStatBufL stat;
    return VSIStatL(path.c_str(), &stat) == 0;
}

// Every file of the directory whose name begins with prefix.
std::vector<std::string> FilesWithPrefix(const std::string& dir, const std::string& prefix) {
    std::vector<std::string> names;
    char** list = VSIReadDir(dir.empty() ? "." : dir.c_str());
    for (char** entry = list; entry != nullptr && *entry != nullptr; ++entry) {
        const std::string name = *entry;
        if (name.compare(0, prefix.size(), prefix) == 0)
            names.push_back(name);
    }
    CSLDestroy(list);
    return names;
}

// Moves a file over another, replacing it in one step where the system allows.
bool ReplaceFile(const std::string& from, const std::string& to) {
#if defined(_WIN32)
    return MoveFileExA(from.c_str(), to.c_str(),
                       MOVEFILE_REPLACE_EXISTING | MOVEFILE_WRITE_THROUGH) != 0;
#else
    return VSIRename(from.c_str(), to.c_str()) == 0;
#endif
}

CPLStringList DefaultCreationOptions(const std::string& format, DataType type) {
    CPLStringList options;
    if (format == "COG") {
        // Deliverable: 512-pixel tiles, lossless compression, overviews averaged.
        options.SetNameValue("BLOCKSIZE", "512");
        options.SetNameValue("COMPRESS", "DEFLATE");
        options.SetNameValue("PREDICTOR", "YES");
        options.SetNameValue("OVERVIEW_RESAMPLING", "AVERAGE");
        options.SetNameValue("BIGTIFF", "IF_SAFER");
        // Deflate level 5 rather than GDAL's 6: on aerial mosaics level 6 takes twice the time
        // (about a tenth of the mosaic step) for files some 8 % smaller.
        options.SetNameValue("LEVEL", "5");
    } else if (format == "GTiff") {
        options.SetNameValue("TILED", "YES");
        options.SetNameValue("BLOCKXSIZE", "256");
        options.SetNameValue("BLOCKYSIZE", "256");
        options.SetNameValue("COMPRESS", "DEFLATE");
        options.SetNameValue("PREDICTOR",
                             type == DataType::Float32 || type == DataType::Float64 ? "3" : "2");
        options.SetNameValue("BIGTIFF", "IF_SAFER");
    }
    return options;
}

// Options "NAME=VALUE" separated by commas, semicolons or blanks.
std::vector<std::string> SplitOptions(const std::string& text) {
    std::vector<std::string> options;
    char** tokens = CSLTokenizeString2(text.c_str(), ",; \t", CSLT_HONOURSTRINGS);
    for (char** token = tokens; token != nullptr && *token != nullptr; ++token)
        options.emplace_back(*token);
    CSLDestroy(tokens);
    return options;
}

// The options of text added to (and overriding) the defaults. A compression given without a
// predictor drops the default predictor unless it is one that takes it; one given without a
// level drops the default (DEFLATE's) level unless it is DEFLATE.
void AddOptions(CPLStringList& options, const std::string& text) {
    bool compress = false;
    bool predictor = false;
    bool level = false;
    for (const std::string& option : SplitOptions(text)) {
        char* key = nullptr;
        const char* value = CPLParseNameValue(option.c_str(), &key);
        if (key != nullptr && value != nullptr) {
            options.SetNameValue(key, value);
            compress = compress || EQUAL(key, "COMPRESS");
            predictor = predictor || EQUAL(key, "PREDICTOR");
            level = level || EQUAL(key, "LEVEL");
        }
        CPLFree(key);
    }
    const char* method = options.FetchNameValue("COMPRESS");
    if (compress && !predictor && method != nullptr && !EQUAL(method, "DEFLATE") &&
        !EQUAL(method, "LZW") && !EQUAL(method, "ZSTD"))
        options.SetNameValue("PREDICTOR", nullptr);
    if (compress && !level && method != nullptr && !EQUAL(method, "DEFLATE"))
        options.SetNameValue("LEVEL", nullptr);
}

bool IsDirectory(const std::string& path) {
    VSIStatBufL stat;
    return VSIStatL(path.c_str(), &stat) == 0 && VSI_ISDIR(stat.st_mode);
}

// The path without the extension of its file name.
std::string Stem(const std::string& path) {
    const PathParts parts = Split(path);
    return parts.dir + parts.stem;
}

// The files of a dataset: GDAL's list when GDAL opens it (a raster or vector dataset with its
// side files), the path alone otherwise. Only files named after the dataset count: a VRT's
// sources, say, belong to other datasets.
std::vector<std::string> DatasetFiles(const std::string& path) {
    std::vector<std::string> files{path};
    gdalsupport::ErrorCapture errors;
    GDALDatasetPtr ds(
        GDALDataset::Open(path.c_str(), GDAL_OF_RASTER | GDAL_OF_VECTOR | GDAL_OF_READONLY));
    if (ds == nullptr)
        return files;
    const std::string stem = Stem(path);
    char** list = ds->GetFileList();
    for (char** f = list; f != nullptr && *f != nullptr; ++f) {
        const std::string file = *f;
        if (file != path && file.compare(0, stem.size(), stem) == 0 && !IsDirectory(file))
            files.push_back(file);
    }
    CSLDestroy(list);
    return files;
}

// A file's name after publishing: the temporary name's part replaced by the final name's.
std::string PublishedName(const std::string& file, const std::string& temporary,
                          const std::string& final) {
    if (file.compare(0, temporary.size(), temporary) == 0)
        return final + file.substr(temporary.size());
    const std::string stem = Stem(temporary);
    return Stem(final) + file.substr(stem.size());
}

}  // namespace

struct BasicWriter::Impl {
    std::string path;
    std::string format;
    GDALDriver* driver = nullptr;
    bool copyOnClose = false;  // the format is made by CreateCopy from a GeoTIFF
    bool update = false;       // an existing file written in place
    std::string options;
    std::vector<unsigned int> channelNumbers;
    unsigned int channelCount = 1;
    DataType type = DataType::Unknown;
    Tiling tiling;
    bool tileSizeSet = false;
    bool noDataAsMask = false;  // the no-data pixels go to a mask band where the format has one
    std::unique_ptr<ogc::cs::ICRS> crs;
    std::unique_ptr<ogc::cs::GeocodingInfo> geocoding;
    std::vector<std::optional<double>> noData;
    std::vector<std::string> descriptions;
    std::vector<MetadataItem> metadata;

    GDALDatasetPtr dataset;  // the file being written
    std::string tempStem;    // base-name prefix of every temporary file
    std::string tempPath;    // the file being written (temporary unless update)
    bool closed = false;
    ChannelInfoList infos;
    std::mutex mutex;

    std::vector<unsigned int> Bands() const {
        std::vector<unsigned int> bands;
        for (unsigned int c = 1; c <= channelCount; ++c)
            bands.push_back(c);
        return bands;
    }

    void RefreshInfos() {
        infos.Clear();
        for (unsigned int c = 0; c < channelCount; ++c) {
            const unsigned int number = c < channelNumbers.size() ? channelNumbers[c] : c + 1;
            const bool has = c < noData.size() && noData[c].has_value();
            infos.Add(
                std::make_unique<ChannelInfo>(number, type, has, has ? *noData[c] : 0.0,
                                              c < descriptions.size() ? descriptions[c] : ""));
        }
    }

    void RemoveTemporaries() {
        if (tempStem.empty())
            return;
        const PathParts parts = Split(path);
        for (const std::string& name : FilesWithPrefix(parts.dir, tempStem))
            VSIUnlink((parts.dir + name).c_str());
    }
};

namespace {

void RequireNotCreated(const BasicWriter::Impl& impl, const char* what,
                       const SourceLocation& where) {
    if (impl.dataset != nullptr || impl.closed || impl.update) {
        KESTREL_THROW_AT(where, DataException,
                         FormatString("The %s of %s cannot change once the file exists", what,
                                      impl.path.c_str()));
    }
}

GDALDriver* RasterDriver(const std::string& format, const std::string& path,
                         const SourceLocation& where) {
    gdalsupport::EnsureRegistered();
    GDALDriver* driver = GetGDALDriverManager()->GetDriverByName(format.c_str());
    if (driver == nullptr || driver->GetMetadataItem(GDAL_DCAP_RASTER) == nullptr ||
        (driver->GetMetadataItem(GDAL_DCAP_CREATE) == nullptr &&
         driver->GetMetadataItem(GDAL_DCAP_CREATECOPY) == nullptr)) {
        KESTREL_THROW_AT(where, ParameterException, "format", ParameterException::Unsupported,
                         format, "a GDAL raster driver that can write files",
                         FormatString("GDAL cannot write %s in the format \"%s\"", path.c_str(),
                                      format.c_str()));
    }
    // Formats whose file is not where the pixels go.
    const std::string name = driver->GetDescription();
    if (name == "VRT")
        KESTREL_THROW_AT(where, ParameterException, "format", ParameterException::Unsupported,
                         format, "a format that holds pixels",
                         FormatString("%s: a VRT file only references other rasters; write the "
                                      "pixels in a format that holds them (tif, gpkg, ...)",
                                      path.c_str()));
    if (name == "ENVI" && EQUAL(Split(path).ext.c_str(), ".hdr"))
        KESTREL_THROW_AT(where, ParameterException, "format", ParameterException::Unsupported,
                         format, "the ENVI data file's name",
                         FormatString("%s names an ENVI header, which the writer makes beside "
                                      "the data file: give the data file's name (.img, .bin, "
                                      ".dat, ...)",
                                      path.c_str()));
    return driver;
}

}  // namespace

BasicWriter::BasicWriter(const std::string& path) : impl_(std::make_unique<Impl>()) {
    gdalsupport::EnsureRegistered();
    impl_->path = path;
    if (Exists(path)) {
        gdalsupport::ErrorCapture errors;
        impl_->dataset.reset(GDALDataset::Open(
            path.c_str(), GDAL_OF_RASTER | GDAL_OF_UPDATE | GDAL_OF_VERBOSE_ERROR));
        if (impl_->dataset == nullptr) {
            KESTREL_THROW(FileAccessException, path, FileAccessException::OpenFailed,
                          FormatString("Could not open %s for update as a raster: %s", path.c_str(),
                                       errors.Reason().c_str()));
        }
        GDALDataset& ds = *impl_->dataset;
        impl_->update = true;
        impl_->tempPath = path;
        impl_->driver = ds.GetDriver();
        impl_->format = impl_->driver != nullptr ? impl_->driver->GetDescription() : "";
        impl_->channelCount = static_cast<unsigned int>(ds.GetRasterCount());
        impl_->type = impl_->channelCount > 0 ? FromGDAL(ds.GetRasterBand(1)->GetRasterDataType())
                                              : DataType::Unknown;
        impl_->tiling.width = static_cast<unsigned int>(ds.GetRasterXSize());
        impl_->tiling.height = static_cast<unsigned int>(ds.GetRasterYSize());
        if (impl_->channelCount > 0) {
            int w = 0;
            int h = 0;
            ds.GetRasterBand(1)->GetBlockSize(&w, &h);
            impl_->tiling.tileWidth = static_cast<unsigned int>(std::max(1, w));
            impl_->tiling.tileHeight = static_cast<unsigned int>(std::max(1, h));
        }
        impl_->crs = ReadCRS(ds);
        impl_->geocoding = ReadGeocoding(ds);
        for (unsigned int c = 1; c <= impl_->channelCount; ++c) {
            int has = 0;
            const double value = ds.GetRasterBand(int(c))->GetNoDataValue(&has);
            impl_->noData.push_back(has ? std::optional<double>(value) : std::nullopt);
            impl_->descriptions.push_back(ds.GetRasterBand(int(c))->GetDescription());
        }
    } else {
        impl_->format = core::FormatNameOfPath(path);
        if (impl_->format.empty())
            impl_->format = "GTiff";
        impl_->driver = RasterDriver(impl_->format, path, KESTREL_HERE);
        impl_->copyOnClose = impl_->driver->GetMetadataItem(GDAL_DCAP_CREATE) == nullptr;
    }
    impl_->RefreshInfos();
    if (auto observer = RasterIOObserver::Current())
        observer->WriterCreated(this, path, {}, "", "");
}

BasicWriter::BasicWriter(const std::string& path, const std::vector<unsigned int>& channels,
                         const std::string& format, const std::string& options)
    : impl_(std::make_unique<Impl>()) {
    impl_->path = path;
    impl_->format = format;
    impl_->options = options;
    impl_->driver = RasterDriver(format, path, KESTREL_HERE);
    impl_->format = impl_->driver->GetDescription();
    core::CheckCreationOptions(impl_->format, SplitOptions(options));
    impl_->copyOnClose = impl_->driver->GetMetadataItem(GDAL_DCAP_CREATE) == nullptr;
    if (channels.empty()) {
        KESTREL_THROW(
            DataException,
            FormatString("A raster writer on %s needs at least one channel", path.c_str()));
    }
    impl_->channelNumbers = channels;
    impl_->channelCount = static_cast<unsigned int>(channels.size());
    impl_->RefreshInfos();
    if (auto observer = RasterIOObserver::Current())
        observer->WriterCreated(this, path, channels, format, options);
}

BasicWriter::~BasicWriter() {
    if (impl_->closed)
        return;
    impl_->dataset.reset();
    if (!impl_->update)
        impl_->RemoveTemporaries();
}

std::string BasicWriter::GetFormatName() const {
    return impl_->format;
}

void BasicWriter::SetSize(unsigned int width, unsigned int height) {
    RequireNotCreated(*impl_, "size", KESTREL_HERE);
    if (width == 0 || height == 0 || width > 0x7fffffffu || height > 0x7fffffffu) {
        KESTREL_THROW(DataException, FormatString("%s cannot be %u x %u pixels",
                                                  impl_->path.c_str(), width, height));
    }
    impl_->tiling.width = width;
    impl_->tiling.height = height;
}

void BasicWriter::SetDataType(DataType type) {
    RequireNotCreated(*impl_, "data type", KESTREL_HERE);
    if (DataTypeSize(type) == 0) {
        KESTREL_THROW(DataException, FormatString("%s cannot be written with data type %s",
                                                  impl_->path.c_str(), DataTypeName(type).c_str()));
    }
    impl_->type = type;
    impl_->RefreshInfos();
}

void BasicWriter::SetChannelCount(unsigned int count) {
    RequireNotCreated(*impl_, "channel count", KESTREL_HERE);
    if (count == 0 || count > 65535) {
        KESTREL_THROW(DataException,
                      FormatString("%s cannot have %u channels", impl_->path.c_str(), count));
    }
    impl_->channelCount = count;
    impl_->channelNumbers.clear();
    impl_->RefreshInfos();
}

void BasicWriter::SetCRS(const ogc::cs::ICRS* crs) {
    RequireNotCreated(*impl_, "coordinate system", KESTREL_HERE);
    impl_->crs.reset(crs != nullptr ? new ogc::cs::ICRS(*crs) : nullptr);
}

void BasicWriter::SetGeocoding(const ogc::cs::GeocodingInfo& geocoding) {
    RequireNotCreated(*impl_, "geocoding", KESTREL_HERE);
    impl_->geocoding = std::make_unique<ogc::cs::GeocodingInfo>(geocoding);
}

void BasicWriter::SetNoDataValue(double value) {
    RequireNotCreated(*impl_, "no-data value", KESTREL_HERE);
    impl_->noData.assign(impl_->channelCount, value);
    impl_->RefreshInfos();
}

void BasicWriter::SetNoDataValue(unsigned int c, double value) {
    RequireNotCreated(*impl_, "no-data value", KESTREL_HERE);
    if (c >= impl_->channelCount) {
        KESTREL_THROW(DataException, FormatString("%s has no channel at position %u of %u",
                                                  impl_->path.c_str(), c, impl_->channelCount));
    }
    impl_->noData.resize(impl_->channelCount);
    impl_->noData[c] = value;
    impl_->RefreshInfos();
}

void BasicWriter::SetChannelDescription(unsigned int c, const std::string& text) {
    RequireNotCreated(*impl_, "channel description", KESTREL_HERE);
    if (c >= impl_->channelCount) {
        KESTREL_THROW(DataException, FormatString("%s has no channel at position %u of %u",
                                                  impl_->path.c_str(), c, impl_->channelCount));
    }
    impl_->descriptions.resize(impl_->channelCount);
    impl_->descriptions[c] = text;
    impl_->RefreshInfos();
}

void BasicWriter::SetNoDataAsMask() {
    RequireNotCreated(*impl_, "mask", KESTREL_HERE);
    impl_->noDataAsMask = true;
}

void BasicWriter::SetMetadataItem(const std::string& name, const std::string& value,
                                  const std::string& domain) {
    RequireNotCreated(*impl_, "metadata", KESTREL_HERE);
    impl_->metadata.push_back({name, value, domain});
}

namespace {

void ApplyDescription(BasicWriter::Impl& impl, GDALDataset& ds, const SourceLocation& where) {
    gdalsupport::ErrorCapture errors;
    auto fail = [&](const char* what) {
        KESTREL_THROW_AT(where, FileAccessException, impl.path, FileAccessException::WriteFailed,
                         FormatString("Could not set the %s of %s: %s", what, impl.path.c_str(),
                                      errors.Reason().c_str()));
    };
    if (impl.geocoding != nullptr) {
        std::array<double, 6> transform = impl.geocoding->GetGeoTransform();
        if (ds.SetGeoTransform(transform.data()) != CE_None)
            fail("geocoding");
    }
    if (impl.crs != nullptr && ds.SetSpatialRef(&impl.crs->GetSpatialReference()) != CE_None)
        fail("coordinate system");
    for (unsigned int c = 0; c < impl.channelCount; ++c) {
        GDALRasterBand* band = ds.GetRasterBand(static_cast<int>(c) + 1);
        if (c < impl.noData.size() && impl.noData[c].has_value() &&
            band->SetNoDataValue(*impl.noData[c]) != CE_None)
            fail("no-data value");
        if (c < impl.descriptions.size() && !impl.descriptions[c].empty())
            band->SetDescription(impl.descriptions[c].c_str());
    }
    for (const MetadataItem& item : impl.metadata) {
        if (ds.SetMetadataItem(item.name.c_str(), item.value.c_str(), item.domain.c_str()) !=
            CE_None)
            fail("metadata");
    }
}

void CreateLocked(BasicWriter::Impl& impl, const SourceLocation& where) {
    if (impl.dataset != nullptr)
        return;
    if (impl.closed) {
        KESTREL_THROW_AT(where, DataException, FormatString("%s is closed", impl.path.c_str()));
    }
    if (impl.tiling.width == 0 || impl.type == DataType::Unknown) {
        KESTREL_THROW_AT(where, DataException,
                         FormatString("%s cannot be created before its size and data type are "
                                      "set",
                                      impl.path.c_str()));
    }
    const PathParts parts = Split(impl.path);
    impl.tempStem = parts.stem + ".tmp-" + RandomTag();
    // A format made by copying is first written as a plain tiled GeoTIFF.
    const std::string workFormat = impl.copyOnClose ? "GTiff" : impl.format;
    const std::string workExt = impl.copyOnClose ? ".tif" : parts.ext;
    impl.tempPath = parts.dir + impl.tempStem + (impl.copyOnClose ? ".work" : "") + workExt;

    CPLStringList options;
    GDALDriver* driver = impl.driver;
    if (impl.copyOnClose) {
        driver = GetGDALDriverManager()->GetDriverByName("GTiff");
        options.SetNameValue("TILED", "YES");
        options.SetNameValue("BIGTIFF", "IF_SAFER");
    } else {
        options = DefaultCreationOptions(workFormat, impl.type);
        AddOptions(options, impl.options);
        // NITF takes a CRS only when told its kind at creation: UTM or geographic.
        if (workFormat == "NITF" && impl.crs != nullptr &&
            options.FetchNameValue("ICORDS") == nullptr) {
            const OGRSpatialReference& srs = impl.crs->GetSpatialReference();
            int north = 0;
            if (srs.GetUTMZone(&north) != 0)
                options.SetNameValue("ICORDS", north ? "N" : "S");
            else if (srs.IsGeographic())
                options.SetNameValue("ICORDS", "G");
        }
    }
    gdalsupport::ErrorCapture errors;
    impl.dataset.reset(driver->Create(impl.tempPath.c_str(), static_cast<int>(impl.tiling.width),
                                      static_cast<int>(impl.tiling.height),
                                      static_cast<int>(impl.channelCount), ToGDAL(impl.type),
                                      options.List()));
    if (impl.dataset == nullptr) {
        const std::string reason = errors.Reason();
        impl.RemoveTemporaries();
        KESTREL_THROW_AT(where, FileAccessException, impl.path, FileAccessException::CreateFailed,
                         FormatString("Could not create %s as %s (%u x %u pixels, %u channels "
                                      "of %s): %s",
                                      impl.path.c_str(), impl.format.c_str(), impl.tiling.width,
                                      impl.tiling.height, impl.channelCount,
                                      DataTypeName(impl.type).c_str(), reason.c_str()));
    }
    try {
        ApplyDescription(impl, *impl.dataset, where);
        if (!impl.tileSizeSet) {
            int w = 0;
            int h = 0;
            impl.dataset->GetRasterBand(1)->GetBlockSize(&w, &h);
            impl.tiling.tileWidth = static_cast<unsigned int>(std::max(1, w));
            impl.tiling.tileHeight = static_cast<unsigned int>(std::max(1, h));
        }
    } catch (...) {
        impl.dataset.reset();
        impl.RemoveTemporaries();
        throw;
    }
}

}  // namespace

void BasicWriter::Create() {
    std::lock_guard<std::mutex> lock(impl_->mutex);
    CreateLocked(*impl_, KESTREL_HERE);
}

void BasicWriter::WriteWindow(const gobs::Raster& raster, unsigned int x, unsigned int y) {
    std::lock_guard<std::mutex> lock(impl_->mutex);
    CreateLocked(*impl_, KESTREL_HERE);
    if (raster.GetChannelCount() != impl_->channelCount) {
        KESTREL_THROW(
            DataException,
            FormatString("A raster of %u channels cannot be written to %s, which has "
                         "%u",
                         raster.GetChannelCount(), impl_->path.c_str(), impl_->channelCount));
    }
    CheckWindow(impl_->path, impl_->tiling.width, impl_->tiling.height, x, y, raster.GetWidth(),
                raster.GetHeight(), KESTREL_HERE);
    TransferWindow(*impl_->dataset, GF_Write, impl_->path, impl_->Bands(),
                   const_cast<gobs::Raster&>(raster), x, y, KESTREL_HERE);
}

void BasicWriter::Write(const gobs::Raster& raster) {
    WriteWindow(raster, raster.GetX(), raster.GetY());
}

gobs::Raster* BasicWriter::ReadWindow(unsigned int x, unsigned int y, unsigned int width,
                                      unsigned int height) {
    std::unique_ptr<gobs::Raster> raster;
    {
        std::lock_guard<std::mutex> lock(impl_->mutex);
        CreateLocked(*impl_, KESTREL_HERE);
        CheckWindow(impl_->path, impl_->tiling.width, impl_->tiling.height, x, y, width, height,
                    KESTREL_HERE);
        raster = std::make_unique<gobs::Raster>(width, height, impl_->channelCount, impl_->type,
                                                gobs::Raster::Initial::Unset);
        raster->SetOrigin(x, y);
        TransferWindow(*impl_->dataset, GF_Read, impl_->path, impl_->Bands(), *raster, x, y,
                       KESTREL_HERE);
    }
    if (auto observer = RasterIOObserver::Current())
        observer->WindowRead(this, x, y, width, height, raster.get());
    return raster.release();
}

namespace {

// Whether a file's CRS places pixels where the written one does: the same, or an equivalent
// definition named differently. A vertical part that the format cannot hold is not counted:
// it does not move pixels.
bool SameCRS(const OGRSpatialReference& read, const OGRSpatialReference& written) {
    if (read.IsSame(&written))
        return true;
    OGRSpatialReference a(read), b(written);
    a.StripVertical();
    b.StripVertical();
    if (a.IsSame(&b))
        return true;
    char* pa = nullptr;
    char* pb = nullptr;
    const bool same = a.exportToProj4(&pa) == OGRERR_NONE && b.exportToProj4(&pb) == OGRERR_NONE &&
                      std::string(pa) == pb;
    CPLFree(pa);
    CPLFree(pb);
    return same;
}

// What of the georeferencing set on the writer the finished file does not give back (empty
// when all of it): some formats store it coarsely (NITF in whole metres) or not at all.
std::string LostGeoreferencing(const BasicWriter::Impl& impl, const std::string& finished) {
    if (impl.crs == nullptr && impl.geocoding == nullptr)
        return "";
    gdalsupport::ErrorCapture errors;
    GDALDatasetPtr ds(GDALDataset::Open(finished.c_str(), GDAL_OF_RASTER | GDAL_OF_READONLY));
    if (ds == nullptr)
        return "pixels (GDAL cannot open the file it wrote: " + errors.Reason() + ")";
    if (impl.geocoding != nullptr) {
        const std::array<double, 6> want = impl.geocoding->GetGeoTransform();
        std::array<double, 6> got{};
        const double pixel = std::max(std::fabs(want[1]) + std::fabs(want[2]), 1e-12);
        bool same = ds->GetGeoTransform(got.data()) == CE_None;
        for (int k = 0; k < 6 && same; ++k)
            same = std::fabs(got[k] - want[k]) <= 1e-6 * pixel;
        if (!same)
            return "geotransform";
    }
    if (impl.crs != nullptr) {
        const OGRSpatialReference* srs = ds->GetSpatialRef();
        if (srs == nullptr || !SameCRS(*srs, impl.crs->GetSpatialReference()))
            return "coordinate system";
    }
    return "";
}

// Whether a value is the no-data value (NaN included).
bool IsNoData(double value, const std::optional<double>& noData) {
    return noData.has_value() && (value == *noData || (std::isnan(value) && std::isnan(*noData)));
}

// Marks with 255 in `valid` the pixels of a window, `values` holding `bands` values a pixel,
// where some band holds other than its no-data value.
template <typename T>
void MarkValid(const std::vector<std::optional<double>>& noData, int bands, const T* values,
               std::size_t count, GByte* valid) {
    for (int b = 0; b < bands; ++b) {
        const std::optional<double> value =
            b < static_cast<int>(noData.size()) ? noData[b] : std::nullopt;
        if (!value.has_value()) {
            std::fill(valid, valid + count, GByte{255});
            return;
        }
        for (std::size_t i = 0; i < count; ++i)
            if (!IsNoData(static_cast<double>(values[i * bands + b]), value))
                valid[i] = 255;
    }
}

// Puts the pixels that are no data in every channel into the GeoTIFF's internal mask, and drops
// the channels' no-data values, so that readers see the mask rather than a colour. The pixels
// are read in the file's own type and order, which costs a fraction of converting them.
template <typename T>
void NoDataToMask(BasicWriter::Impl& impl, GDALDataset& ds, GDALDataType type) {
    CPLConfigOptionSetter internal("GDAL_TIFF_INTERNAL_MASK", "YES", true);
    if (ds.CreateMaskBand(GMF_PER_DATASET) != CE_None)
        return;
    GDALRasterBand* mask = ds.GetRasterBand(1)->GetMaskBand();
    const int width = ds.GetRasterXSize();
    const int height = ds.GetRasterYSize();
    const int bands = static_cast<int>(impl.channelCount);
    const int step = 512;
    std::vector<T> values;
    std::vector<GByte> valid;
    for (int y = 0; y < height; y += step) {
        for (int x = 0; x < width; x += step) {
            const int w = std::min(step, width - x);
            const int h = std::min(step, height - y);
            const std::size_t count = static_cast<std::size_t>(w) * h;
            values.resize(count * bands);
            valid.assign(count, 0);
            const GSpacing pixel = static_cast<GSpacing>(sizeof(T)) * bands;
            if (ds.RasterIO(GF_Read, x, y, w, h, values.data(), w, h, type, bands, nullptr, pixel,
                            pixel * w, sizeof(T), nullptr) != CE_None)
                return;
            MarkValid(impl.noData, bands, values.data(), count, valid.data());
            if (mask->RasterIO(GF_Write, x, y, w, h, valid.data(), w, h, GDT_Byte, 0, 0,
                               nullptr) != CE_None)
                return;
        }
    }
    for (int b = 1; b <= bands; ++b)
        ds.GetRasterBand(b)->DeleteNoDataValue();
}

void NoDataToMask(BasicWriter::Impl& impl, GDALDataset& ds) {
    if (std::none_of(impl.noData.begin(), impl.noData.end(),
                     [](const std::optional<double>& v) { return v.has_value(); }))
        return;
    switch (const GDALDataType type = ds.GetRasterBand(1)->GetRasterDataType()) {
    case GDT_Byte:
        return NoDataToMask<GByte>(impl, ds, type);
    case GDT_UInt16:
        return NoDataToMask<GUInt16>(impl, ds, type);
    case GDT_Int16:
        return NoDataToMask<GInt16>(impl, ds, type);
    case GDT_UInt32:
        return NoDataToMask<GUInt32>(impl, ds, type);
    case GDT_Int32:
        return NoDataToMask<GInt32>(impl, ds, type);
    case GDT_Float32:
        return NoDataToMask<float>(impl, ds, type);
    default:
        return NoDataToMask<double>(impl, ds, GDT_Float64);
    }
}

}  // namespace

void BasicWriter::Close() {
    std::lock_guard<std::mutex> lock(impl_->mutex);
    Impl& impl = *impl_;
    if (impl.closed)
        return;
    if (impl.update) {
        gdalsupport::ErrorCapture errors;
        impl.dataset->FlushCache(false);
        impl.dataset.reset();
        impl.closed = true;
        if (errors.Failed()) {
            KESTREL_THROW(FileAccessException, impl.path, FileAccessException::WriteFailed,
                          FormatString("Could not complete %s: %s", impl.path.c_str(),
                                       errors.Reason().c_str()));
        }
        return;
    }
    CreateLocked(impl, KESTREL_HERE);
    const PathParts parts = Split(impl.path);
    auto fail = [&](const std::string& what, const std::string& reason) {
        impl.dataset.reset();
        impl.RemoveTemporaries();
        impl.closed = true;
        KESTREL_THROW(
            FileAccessException, impl.path, FileAccessException::WriteFailed,
            FormatString("Could not %s %s: %s", what.c_str(), impl.path.c_str(), reason.c_str()));
    };
    {
        gdalsupport::ErrorCapture errors;
        impl.dataset->FlushCache(false);
        if (impl.noDataAsMask && EQUAL(impl.dataset->GetDriverName(), "GTiff") &&
            !errors.Failed())
            NoDataToMask(impl, *impl.dataset);
        if (impl.copyOnClose && !errors.Failed()) {
            CPLStringList options = DefaultCreationOptions(impl.format, impl.type);
            AddOptions(options, impl.options);
            // The COG driver computes the overviews into a temporary ZSTD file that it reads
            // back once; at ZSTD's fastest level rather than its default 9 the file is written
            // in a fraction of the time, and the output is the same bytes. Not when the COG is
            // ZSTD itself, whose own overviews the setting would reach too.
            const char* method = options.FetchNameValue("COMPRESS");
            std::optional<CPLConfigOptionSetter> fastOverviews;
            if (impl.format == "COG" &&
                (method == nullptr || std::string(method).find("ZSTD") == std::string::npos))
                fastOverviews.emplace("ZSTD_LEVEL_OVERVIEW", "1", true);
            const std::string copyPath = parts.dir + impl.tempStem + parts.ext;
            GDALDatasetPtr copy(impl.driver->CreateCopy(copyPath.c_str(), impl.dataset.get(), TRUE,
                                                        options.List(), nullptr, nullptr));
            if (copy == nullptr || errors.Failed())
                fail("write", errors.Reason());
            copy.reset();
        }
        impl.dataset.reset();
        if (errors.Failed())
            fail("write", errors.Reason());
    }
    if (impl.copyOnClose) {
        for (const std::string& name : FilesWithPrefix(parts.dir, impl.tempStem + ".work"))
            VSIUnlink((parts.dir + name).c_str());
    }
    if (impl.format == "MEM") {
        impl.closed = true;
        return;
    }
    const std::string finished = parts.dir + impl.tempStem + parts.ext;
    const std::string lost = LostGeoreferencing(impl, finished);
    if (!lost.empty())
        fail("write",
             FormatString("the %s format does not keep its %s; write it as tif, gpkg or img",
                          impl.format.c_str(), lost.c_str()));
    try {
        PublishDataset(finished, impl.path);
    } catch (...) {
        impl.RemoveTemporaries();
        impl.closed = true;
        throw;
    }
    impl.RemoveTemporaries();
    impl.closed = true;
}

void PublishDataset(const std::string& temporary, const std::string& final) {
    gdalsupport::EnsureRegistered();
    // The new files, the main one last, so that the final name shows the new dataset only
    // once its side files are in place.
    std::vector<std::pair<std::string, std::string>> moves;
    for (const std::string& file : DatasetFiles(temporary))
        if (file != temporary)
            moves.emplace_back(file, PublishedName(file, temporary, final));
    moves.emplace_back(temporary, final);
    // The files an older dataset has under the final names, the main one first.
    std::vector<std::string> old;
    if (Exists(final) && !IsDirectory(final))
        old = DatasetFiles(final);
    for (const auto& move : moves)
        if (Exists(move.second) && !IsDirectory(move.second) &&
            std::find(old.begin(), old.end(), move.second) == old.end())
            old.push_back(move.second);

    auto removeNew = [&] {
        for (const auto& move : moves)
            VSIUnlink(move.first.c_str());
    };
    auto fail = [&](const std::string& from, const std::string& to) {
        const std::string reason = VSIStrerror(errno);
        removeNew();
        KESTREL_THROW(FileAccessException, final, FileAccessException::WriteFailed,
                      FormatString("Could not publish %s: renaming %s to %s failed: %s",
                                   final.c_str(), from.c_str(), to.c_str(), reason.c_str()));
    };
    // A single file replaces a single file in one step.
    if (moves.size() == 1 && old.size() <= 1) {
        if (!ReplaceFile(temporary, final))
            fail(temporary, final);
        return;
    }
    // Otherwise the older files step aside first (the main one first, so that its name never
    // shows it with new side files), and come back if the new ones cannot all be put in place.
    const std::string tag = ".old-" + RandomTag();
    std::vector<std::string> asideDone;
    auto restore = [&] {
        for (auto it = asideDone.rbegin(); it != asideDone.rend(); ++it)
            VSIRename((*it + tag).c_str(), it->c_str());
    };
    for (const std::string& file : old) {
        if (VSIRename(file.c_str(), (file + tag).c_str()) != 0) {
            const int error = errno;
            restore();
            errno = error;
            fail(file, file + tag);
        }
        asideDone.push_back(file);
    }
    std::vector<std::string> placed;
    for (const auto& move : moves) {
        if (VSIRename(move.first.c_str(), move.second.c_str()) != 0) {
            const int error = errno;
            for (const std::string& file : placed)
                VSIUnlink(file.c_str());
            restore();
            errno = error;
            fail(move.first, move.second);
        }
        placed.push_back(move.second);
    }
    for (const std::string& file : asideDone)
        VSIUnlink((file + tag).c_str());
}

bool BasicWriter::IsClosed() const {
    return impl_->closed;
}

gobs::Raster* BasicWriter::GetRaster(unsigned int index) {
    if (index >= impl_->tiling.Count()) {
        KESTREL_THROW(DataException,
                      FormatString("Tile %u of %s does not exist: there are %u", index,
                                   impl_->path.c_str(), impl_->tiling.Count()));
    }
    const Window w = impl_->tiling.Tile(index);
    return ReadWindow(w.x, w.y, w.width, w.height);
}

RasterIterator BasicWriter::FindRaster(unsigned int x, unsigned int y) {
    return RasterIterator(this, impl_->tiling.Find(x, y));
}
RasterIterator BasicWriter::Begin() {
    return RasterIterator(this, 0);
}
RasterIterator BasicWriter::End() {
    return RasterIterator(this, impl_->tiling.Count());
}
unsigned int BasicWriter::GetTileCount() const {
    return impl_->tiling.Count();
}
void BasicWriter::SetOptimalTileSize() {
    std::lock_guard<std::mutex> lock(impl_->mutex);
    impl_->tileSizeSet = false;
    if (impl_->dataset != nullptr) {
        int w = 0;
        int h = 0;
        impl_->dataset->GetRasterBand(1)->GetBlockSize(&w, &h);
        impl_->tiling.tileWidth = static_cast<unsigned int>(std::max(1, w));
        impl_->tiling.tileHeight = static_cast<unsigned int>(std::max(1, h));
    } else {
        // The block size of the files this writer creates.
        impl_->tiling.tileWidth = 256;
        impl_->tiling.tileHeight = 256;
    }
}
void BasicWriter::SetTileSize(unsigned int width, unsigned int height) {
    if (width == 0 || height == 0) {
        KESTREL_THROW(DataException,
                      FormatString("Tile size %u x %u of %s: tiles need at least one pixel", width,
                                   height, impl_->path.c_str()));
    }
    impl_->tiling.tileWidth = width;
    impl_->tiling.tileHeight = height;
    impl_->tileSizeSet = true;
}
unsigned int BasicWriter::GetTileWidth() const {
    return impl_->tiling.tileWidth;
}
unsigned int BasicWriter::GetTileHeight() const {
    return impl_->tiling.tileHeight;
}
const std::vector<IChannelInfo*>& BasicWriter::GetChannelsInfo() const {
    return impl_->infos.View();
}
std::string BasicWriter::GetPath() const {
    return impl_->path;
}
unsigned int BasicWriter::GetWidth() const {
    return impl_->tiling.width;
}
unsigned int BasicWriter::GetHeight() const {
    return impl_->tiling.height;
}
unsigned int BasicWriter::GetChannelCount() const {
    return impl_->channelCount;
}
std::vector<unsigned int> BasicWriter::GetChannels() const {
    std::vector<unsigned int> channels;
    for (unsigned int c = 0; c < impl_->channelCount; ++c)
        channels.push_back(c < impl_->channelNumbers.size() ? impl_->channelNumbers[c] : c + 1);
    return channels;
}
DataType BasicWriter::GetDataType() const {
    return impl_->type;
}
const ogc::cs::ICRS* BasicWriter::GetCRS() const {
    return impl_->crs.get();
}
const ogc::cs::GeocodingInfo* BasicWriter::GetGeocoding() const {
    return impl_->geocoding.get();
}
bool BasicWriter::GetNoDataValue(unsigned int c, double& value) const {
    if (c >= impl_->noData.size() || !impl_->noData[c].has_value())
        return false;
    value = *impl_->noData[c];
    return true;
}

}  // namespace datasources
}  // namespace kestrel
