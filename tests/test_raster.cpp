// Raster datasets, readers and writers on GDAL, and the utility functions that make them.
#include <algorithm>
#include <cstdlib>
#include <limits>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include <gdal_priv.h>
#include <gtest/gtest.h>

#include <kestrel/formats.h>
#include <kestrel/orthoutils.h>
#include <kestrel/rasterio.h>
#include <silvan/utils.h>

#include "support.h"

#if !defined(_WIN32)
#include <sys/resource.h>
#include <csignal>
#endif

using kestrel::datasources::BasicReader;
using kestrel::datasources::BasicWriter;
using kestrel::datasources::DataType;
using kestrel::datasources::IDataset;
using kestrel::datasources::IRasterDataset;
using kestrel::datasources::IRasterReader;
using kestrel::datasources::IRasterWriter;
using kestrel::gobs::Raster;
using testsupport::Contains;
using testsupport::TempDir;
using testsupport::Thrown;
using testsupport::ThrownMessage;

namespace {

// The value of a test image at (x, y) of band b (from 1): distinct per band and pixel.
double Pattern(int x, int y, int b) {
    return (x * 7 + y * 13 + b * 50) % 251;
}

struct ImageSpec {
    int width = 300;
    int height = 200;
    const char* blocks = "TILED=YES";
    bool noData = false;
};

// A georeferenced three-band Byte GeoTIFF of Pattern, made with GDAL itself.
std::string MakeImage(const TempDir& dir, const std::string& name, const ImageSpec& spec) {
    GDALAllRegister();
    const std::string path = dir.File(name);
    const char* options[] = {spec.blocks, nullptr};
    GDALDataset* ds = GetGDALDriverManager()->GetDriverByName("GTiff")->Create(
        path.c_str(), spec.width, spec.height, 3, GDT_Byte, const_cast<char**>(options));
    double gt[6] = {500000, 0.5, 0, 4100000, 0, -0.5};
    ds->SetGeoTransform(gt);
    OGRSpatialReference srs;
    srs.importFromEPSG(32632);
    ds->SetSpatialRef(&srs);
    std::vector<double> line(spec.width);
    for (int b = 1; b <= 3; ++b) {
        if (spec.noData)
            ds->GetRasterBand(b)->SetNoDataValue(0);
        for (int y = 0; y < spec.height; ++y) {
            for (int x = 0; x < spec.width; ++x)
                line[x] = Pattern(x, y, b);
            EXPECT_EQ(ds->GetRasterBand(b)->RasterIO(GF_Write, 0, y, spec.width, 1, line.data(),
                                                     spec.width, 1, GDT_Float64, 0, 0, nullptr),
                      CE_None);
        }
    }
    GDALClose(ds);
    return path;
}

// A VRT whose bands have the types given (no pixels: for what depends on types alone).
std::string MakeTypedBands(const TempDir& dir, const std::vector<GDALDataType>& types) {
    GDALAllRegister();
    const std::string path = dir.File("typed.vrt");
    GDALDataset* ds = GetGDALDriverManager()->GetDriverByName("VRT")->Create(
        path.c_str(), 8, 8, 0, GDT_Unknown, nullptr);
    for (GDALDataType type : types)
        ds->AddBand(type, nullptr);
    GDALClose(ds);
    return path;
}

}  // namespace

// ---------------------------------------------------------------------------------------------
// Rasters in memory

// A new raster is zero-filled even where its memory held other values before (the allocator
// hands back freed blocks as they were).
TEST(Raster, NewRastersAreZeroWhateverTheMemoryHeldBefore) {
    for (int round = 0; round < 4; ++round) {
        {
            volatile std::vector<double> previous(8192, -1.5);  // freed just before
        }
        const Raster raster(64, 64, 2, DataType::Float32);
        const float* values = static_cast<const float*>(raster.GetData());
        ASSERT_TRUE(std::all_of(values, values + raster.GetPlaneSize() * 2, [](float v) {
            return v == 0.0f;
        })) << round;
    }
}

// ---------------------------------------------------------------------------------------------
// Datasets

TEST(RasterDataset, DescribesTheFileAsGdalDoes) {
    TempDir dir;
    ImageSpec spec;
    spec.noData = true;
    const std::string path = MakeImage(dir, "a.tif", spec);
    std::unique_ptr<IDataset> ds(GetRasterDataset(path));
    auto* raster = dynamic_cast<IRasterDataset*>(ds.get());
    ASSERT_NE(raster, nullptr);
    EXPECT_EQ(raster->GetWidth(), 300u);
    EXPECT_EQ(raster->GetHeight(), 200u);
    EXPECT_EQ(raster->GetChannelCount(), 3u);
    EXPECT_EQ(raster->GetDataType(2), DataType::Byte);
    double noData = -1;
    EXPECT_TRUE(raster->GetNoDataValue(3, noData));
    EXPECT_EQ(noData, 0);
    ASSERT_NE(raster->GetCRS(), nullptr);
    EXPECT_TRUE(raster->GetCRS()->IsSame(kestrel::ogc::cs::ICRS("EPSG:32632")));
    ASSERT_NE(raster->GetGeocoding(), nullptr);
    EXPECT_EQ(raster->GetGeocoding()->GetGeoTransform()[0], 500000);
    EXPECT_EQ(raster->GetFormatName(), "GTiff");
}

TEST(RasterDataset, PathThatIsNoRasterThrowsFileNotFoundWithThePath) {
    TempDir dir;
    for (const std::string& path :
         {dir.File("missing.tif"), testsupport::WriteFile(dir.File("junk.tif"), "not a tiff")}) {
        if (const auto e = Thrown<kestrel::FileNotFoundException>(
                [&] { delete GetRasterDataset(path); }, path)) {
            EXPECT_EQ(e->GetFileName(), path);
            EXPECT_EQ(e->GetErrorMessage(), "");
            testsupport::ExpectThrownFrom(*e, e->GetFunction(), "utils.cpp");
            EXPECT_TRUE(Contains(e->GetFunction(), "GetRasterDataset"));
        }
    }
    // The platform's own dataset is never null and says why it is not valid.
    IDataset* ds = nullptr;
    unsigned int w = 1;
    unsigned int h = 1;
    GetSrcDataset(dir.File("missing.tif"), ds, w, h);
    ASSERT_NE(ds, nullptr);
    EXPECT_FALSE(ds->IsValid());
    EXPECT_NE(ds->GetInvalidReason().find("missing.tif"), std::string::npos);
    delete ds;
}

// ---------------------------------------------------------------------------------------------
// Readers

TEST(RasterReader, ReadsTheSamePixelsAsGdal) {
    TempDir dir;
    ImageSpec spec;
    spec.blocks = "BLOCKYSIZE=7";  // strips, cut across by the window
    const std::string path = MakeImage(dir, "a.tif", spec);
    std::unique_ptr<IRasterReader> reader(GetRasterReader(path));
    std::unique_ptr<Raster> window(reader->ReadWindow(290, 195, 10, 5));
    ASSERT_EQ(window->GetChannelCount(), 3u);
    EXPECT_EQ(window->GetX(), 290u);
    EXPECT_EQ(window->GetY(), 195u);
    for (unsigned int c = 0; c < 3; ++c)
        for (unsigned int y = 0; y < 5; ++y)
            for (unsigned int x = 0; x < 10; ++x)
                ASSERT_EQ(window->GetValue(c, x, y), Pattern(290 + x, 195 + y, c + 1));
    // Band-sequential buffer.
    const auto* bytes = static_cast<const unsigned char*>(window->GetData());
    EXPECT_EQ(bytes[50 + 10 + 3], Pattern(293, 196, 2));
}

TEST(RasterReader, ChannelsOfADatasetInTheOrderGiven) {
    TempDir dir;
    const std::string path = MakeImage(dir, "a.tif", ImageSpec());
    std::unique_ptr<IDataset> ds(GetRasterDataset(path));
    std::unique_ptr<IRasterReader> reader(GetRasterReader(ds.get(), {3, 1}));
    EXPECT_EQ(reader->GetChannels(), (std::vector<unsigned int>{3, 1}));
    std::unique_ptr<Raster> window(reader->ReadWindow(4, 5, 2, 2));
    EXPECT_EQ(window->GetValue(0, 1, 1), Pattern(5, 6, 3));
    EXPECT_EQ(window->GetValue(1, 1, 1), Pattern(5, 6, 1));
    ASSERT_EQ(reader->GetChannelsInfo().size(), 2u);
    EXPECT_EQ(reader->GetChannelsInfo()[0]->GetChannel(), 3u);
    reader.reset();
    // The dataset stays the caller's.
    EXPECT_TRUE(ds->IsValid());
}

TEST(RasterReader, TilesCoverTheImageOnce) {
    TempDir dir;
    ImageSpec spec;
    spec.width = 600;
    spec.height = 300;
    const std::string path = MakeImage(dir, "a.tif", spec);
    std::unique_ptr<IDataset> ds(GetRasterDataset(path));
    BasicReader reader(ds.get(), {3, 1}, false);
    reader.SetTileSize(7, 7);
    reader.SetOptimalTileSize();  // the file's blocks: whole blocks are read block by block
    EXPECT_EQ(reader.GetTileWidth(), 256u);
    EXPECT_EQ(reader.GetTileCount(), 3u * 2u);
    unsigned long long pixels = 0;
    unsigned int count = 0;
    for (auto it = reader.Begin(); it != reader.End(); ++it, ++count) {
        std::unique_ptr<Raster> tile(*it);
        EXPECT_EQ(tile->GetX(), it.GetX());
        EXPECT_EQ(tile->GetY(), it.GetY());
        for (unsigned int y = 0; y < tile->GetHeight(); ++y)
            for (unsigned int x = 0; x < tile->GetWidth(); ++x) {
                ASSERT_EQ(tile->GetValue(0, x, y), Pattern(it.GetX() + x, it.GetY() + y, 3));
                ASSERT_EQ(tile->GetValue(1, x, y), Pattern(it.GetX() + x, it.GetY() + y, 1));
            }
        pixels += static_cast<unsigned long long>(tile->GetWidth()) * tile->GetHeight();
    }
    EXPECT_EQ(count, 6u);
    EXPECT_EQ(pixels, 600u * 300u);
    auto found = reader.FindRaster(599, 299);
    EXPECT_EQ(found.GetIndex(), 5u);
    EXPECT_EQ(found.GetWidth(), 600u - 512u);
    EXPECT_TRUE(reader.FindRaster(600, 0) == reader.End());
}

TEST(RasterReader, BadInputGivesClearErrors) {
    TempDir dir;
    const std::string path = MakeImage(dir, "a.tif", ImageSpec());
    BasicReader reader(path);
    for (auto w : std::vector<std::vector<unsigned int>>{
             {0, 0, 0, 1}, {299, 0, 2, 1}, {0, 199, 1, 2}, {4000000000u, 0, 1, 1}}) {
        EXPECT_TRUE(Contains(ThrownMessage<kestrel::DataException>(
                                 [&] { delete reader.ReadWindow(w[0], w[1], w[2], w[3]); }),
                             "a.tif"))
            << w[0];
    }
    std::unique_ptr<IDataset> ds(GetRasterDataset(path));
    const std::string channel = ThrownMessage<kestrel::DataException>([&] {
        delete GetRasterReader(ds.get(), {1, 4});
    });
    EXPECT_TRUE(Contains(channel, "Channel 4") && Contains(channel, "3 channels")) << channel;
    EXPECT_THROW(BasicReader(dir.File("none.tif")), kestrel::FileNotFoundException);
    // A truncated file opens but cannot be read: the probe reports it with GDAL's reason.
    const std::string bytes = testsupport::ReadFile(path);
    const std::string cut =
        testsupport::WriteFile(dir.File("cut.tif"), bytes.substr(0, bytes.size() / 3));
    const auto e = Thrown<kestrel::FileAccessException>([&] { delete GetRasterReader(cut); });
    EXPECT_EQ(e ? e->GetFileName() : "", cut);
}

// ---------------------------------------------------------------------------------------------
// Writers

namespace {

// Writes a 64 x 48 ortho (byte unless told) with CRS, geocoding and no-data 0, tile by tile.
void WriteOrtho(IRasterWriter& writer, DataType type = DataType::Byte) {
    writer.SetSize(64, 48);
    writer.SetDataType(type);
    const kestrel::ogc::cs::ICRS crs("EPSG:32632");
    writer.SetCRS(&crs);
    writer.SetGeocoding(kestrel::ogc::cs::GeocodingInfo::NorthUp(500000, 4100000, 0.5, 0.5));
    writer.SetNoDataValue(0);
    writer.SetTileSize(32, 16);
    for (auto it = writer.Begin(); it != writer.End(); ++it) {
        std::unique_ptr<Raster> tile(*it);
        for (unsigned int c = 0; c < tile->GetChannelCount(); ++c)
            for (unsigned int y = 0; y < tile->GetHeight(); ++y)
                for (unsigned int x = 0; x < tile->GetWidth(); ++x)
                    tile->SetValue(c, x, y, Pattern(tile->GetX() + x, tile->GetY() + y, c + 1));
        writer.Write(*tile);
    }
}

}  // namespace

// Every file type FType2FormatName knows, written through the writer and read back by GDAL:
// the pixels (lossy formats aside), the CRS, the geotransform, and the no-data value or a mask.
// Formats of one channel get one; a few are refused, each with a message that says why.
TEST(RasterWriter, EveryFileTypeRoundTripsWithItsGeoreferencing) {
    const std::set<std::string> oneChannel{"gif", "asc", "xyz", "bt", "nc"};
    const std::set<std::string> lossy{"jpg", "jpeg", "webp", "jp2"};
    const std::map<std::string, std::string> refused{
        {"vrt", "only references"},  // holds no pixels of its own
        {"hdr", "header"},           // the data file's name is needed, not the header's
        {"mbtiles", "zoom level"},   // Web Mercator tiles only
        {"ntf", "geotransform"},     // corners in whole metres
        {"nitf", "geotransform"},
        {"rsw", "coordinate system"},   // GDAL's RMF writes another UTM zone
        {"xyz", "coordinate system"}};  // text without georeferencing
    GDALAllRegister();
    OGRSpatialReference utm;
    utm.importFromEPSG(32632);
    TempDir dir;
    for (const std::string& type : kestrel::core::KnownFileTypes()) {
        SCOPED_TRACE(type);
        const std::string format = kestrel::core::FType2FormatName(type);
        if (type == "mem" || GetGDALDriverManager()->GetDriverByName(format.c_str()) == nullptr)
            continue;  // no file, or a driver this GDAL lacks
        const std::string path = dir.File("ortho." + type);
        const unsigned int channels = oneChannel.count(type) ? 1 : 3;
        try {
            std::unique_ptr<IRasterWriter> writer(GetRasterWriter(
                path, type,
                channels == 1 ? std::vector<unsigned int>{1} : std::vector<unsigned int>{1, 2, 3}));
            WriteOrtho(*writer, type == "bt" ? DataType::Int16 : DataType::Byte);
            EXPECT_FALSE(std::filesystem::exists(path));
            writer->Close();
            EXPECT_EQ(refused.count(type), 0u) << "not refused";
        } catch (const kestrel::Exception& e) {
            const auto reason = refused.find(type);
            EXPECT_TRUE(reason != refused.end() &&
                        std::string(e.what()).find(reason->second) != std::string::npos)
                << e.what();
            continue;
        }
        std::unique_ptr<GDALDataset> ds(
            GDALDataset::Open(path.c_str(), GDAL_OF_RASTER | GDAL_OF_READONLY));
        ASSERT_TRUE(ds != nullptr);
        ASSERT_GE(ds->GetRasterCount(), static_cast<int>(channels));  // GeoPackage adds alpha
        EXPECT_TRUE(ds->GetSpatialRef() != nullptr && ds->GetSpatialRef()->IsSame(&utm));
        double gt[6] = {};
        EXPECT_EQ(ds->GetGeoTransform(gt), CE_None);
        EXPECT_EQ(std::vector<double>(gt, gt + 6),
                  (std::vector<double>{500000, 0.5, 0, 4100000, 0, -0.5}));
        GDALRasterBand* band = ds->GetRasterBand(1);
        int hasNoData = 0;
        const double noData = band->GetNoDataValue(&hasNoData);
        EXPECT_TRUE((hasNoData && noData == 0) || band->GetMaskFlags() != GMF_ALL_VALID);
        std::vector<double> values(64 * 48);
        ASSERT_EQ(band->RasterIO(GF_Read, 0, 0, 64, 48, values.data(), 64, 48, GDT_Float64, 0, 0,
                                 nullptr),
                  CE_None);
        int differ = 0;
        for (int y = 0; y < 48; ++y)
            for (int x = 0; x < 64; ++x)
                differ += values[y * 64 + x] != Pattern(x, y, 1);
        EXPECT_EQ(differ > 0, lossy.count(type) > 0) << differ << " values differ";
    }
    // Nothing but the outputs (and their side files) is left in the directory.
    for (const auto& entry : std::filesystem::directory_iterator(dir.Path()))
        EXPECT_EQ(entry.path().filename().string().find(".tmp-"), std::string::npos)
            << entry.path();
}

// A COG: tiles of 512 (or as asked), lossless DEFLATE with a predictor unless a lossy method
// is asked for, averaged overviews, and the empty pixels in a mask rather than a no-data colour.
// Creation options the driver does not take are refused, naming them, before any file exists.
TEST(RasterWriter, CogIsTiledCompressedWithAveragedOverviewsAndAMask) {
    TempDir dir;
    const struct {
        std::string options;
        int block;
        std::string compression;
        bool predictor;
        bool overviews;
    } cases[] = {{"", 512, "DEFLATE", true, false},
                 {"BLOCKSIZE=128", 128, "DEFLATE", true, true},
                 {"BLOCKSIZE=128 COMPRESS=JPEG QUALITY=90", 128, "JPEG", false, true}};
    for (const auto& c : cases) {
        SCOPED_TRACE(c.options);
        const std::string path = dir.File("mosaic.tif");
        {
            BasicWriter writer(path, {1, 2, 3}, "COG", c.options);
            writer.SetSize(300, 200);
            writer.SetDataType(DataType::Byte);
            writer.SetNoDataValue(0);
            writer.SetNoDataAsMask();
            Raster raster(300, 200, 3, DataType::Byte, Raster::Initial::Zeros);
            for (unsigned int b = 0; b < 3; ++b)
                for (int y = 0; y < 200; ++y)
                    for (int x = 16; x < 300; ++x)  // the first 16 columns are empty
                        raster.SetValue(b, x, y, 1 + Pattern(x, y, b + 1));
            writer.Write(raster);
            writer.Close();
        }
        std::unique_ptr<GDALDataset> ds(
            GDALDataset::Open(path.c_str(), GDAL_OF_RASTER | GDAL_OF_READONLY));
        ASSERT_TRUE(ds != nullptr);
        const char* layout = ds->GetMetadataItem("LAYOUT", "IMAGE_STRUCTURE");
        const char* compression = ds->GetMetadataItem("COMPRESSION", "IMAGE_STRUCTURE");
        EXPECT_STREQ(layout, "COG");
        EXPECT_NE(std::string(compression ? compression : "").find(c.compression),
                  std::string::npos);
        EXPECT_EQ(ds->GetMetadataItem("PREDICTOR", "IMAGE_STRUCTURE") != nullptr, c.predictor);
        GDALRasterBand* band = ds->GetRasterBand(1);
        int w = 0, h = 0, hasNoData = 0;
        band->GetBlockSize(&w, &h);
        EXPECT_EQ(w, c.block);
        band->GetNoDataValue(&hasNoData);
        EXPECT_FALSE(hasNoData);
        EXPECT_EQ(band->GetMaskFlags(), GMF_PER_DATASET);
        GByte mask[2] = {};
        ASSERT_EQ(band->GetMaskBand()->RasterIO(GF_Read, 15, 10, 2, 1, mask, 2, 1, GDT_Byte, 0, 0,
                                                nullptr),
                  CE_None);
        EXPECT_EQ(mask[0], 0);
        EXPECT_EQ(mask[1], 255);
        EXPECT_EQ(band->GetOverviewCount() > 0, c.overviews);
        if (c.overviews && c.compression == "DEFLATE") {
            // Averaged: the overview pixel is the mean of the four it covers (none of them).
            GByte reduced = 0;
            ASSERT_EQ(band->GetOverview(0)->RasterIO(GF_Read, 12, 5, 1, 1, &reduced, 1, 1,
                                                     GDT_Byte, 0, 0, nullptr),
                      CE_None);
            double sum = 0;
            for (int y = 10; y < 12; ++y)
                for (int x = 24; x < 26; ++x)
                    sum += 1 + Pattern(x, y, 1);
            EXPECT_NEAR(reduced, sum / 4, 0.51);
        }
    }

    const struct {
        std::string format;
        std::string option;
        std::string message;
    } refused[] = {{"COG", "FOO=BAR", "does not support creation option FOO"},
                   {"COG", "COMPRESS=ZIP", "ZIP"},
                   {"COG", "QUALITY", "NAME=VALUE"},
                   {"GTiff", "BLOCKSIZE=128", "does not support creation option BLOCKSIZE"},
                   {"COG", "BLOCKSIZE=16", "should be >= 128"}};
    for (const auto& r : refused) {
        SCOPED_TRACE(r.option);
        if (const auto e = Thrown<kestrel::ParameterException>([&] {
                BasicWriter(dir.File("refused.tif"), {1}, r.format, "BIGTIFF=IF_SAFER " + r.option);
            })) {
            EXPECT_EQ(e->GetValue(), r.option);
            EXPECT_TRUE(Contains(e->what(), r.message) && Contains(e->what(), r.format + " driver"))
                << e->what();
        }
        EXPECT_FALSE(std::filesystem::exists(dir.File("refused.tif")));
    }
}

// The mask leaves out exactly the pixels that are no data in every channel, whatever the data
// type (NaN included); a channel without a no-data value makes every pixel valid.
TEST(RasterWriter, MaskLeavesOutThePixelsThatAreNoDataInEveryChannel) {
    TempDir dir;
    const double nan = std::numeric_limits<double>::quiet_NaN();
    const struct {
        DataType type;
        double noData;
        unsigned int channelsWithNoData;
    } cases[] = {{DataType::Byte, 0, 3},     {DataType::UInt16, 65535, 3},
                 {DataType::Int16, -1, 3},   {DataType::Int32, -9999, 3},
                 {DataType::Float32, nan, 3}, {DataType::Float64, -1e30, 3},
                 {DataType::Byte, 0, 2}};
    for (const auto& c : cases) {
        SCOPED_TRACE(std::to_string(static_cast<int>(c.type)) + " " + std::to_string(c.noData) +
                     " in " + std::to_string(c.channelsWithNoData) + " channels");
        const std::string path = dir.File("masked.tif");
        const int width = 40, height = 24;
        auto empty = [](int x, int y) { return (x + y) % 5 == 0; };
        {
            BasicWriter writer(path, {1, 2, 3}, "GTiff", "");
            writer.SetSize(width, height);
            writer.SetDataType(c.type);
            for (unsigned int b = 0; b < c.channelsWithNoData; ++b)
                writer.SetNoDataValue(b, c.noData);
            writer.SetNoDataAsMask();
            Raster raster(width, height, 3, c.type);
            for (unsigned int b = 0; b < 3; ++b)
                for (int y = 0; y < height; ++y)
                    for (int x = 0; x < width; ++x) {
                        // The first channel alone is no data in every seventh column.
                        const bool none = empty(x, y) || (b == 0 && x % 7 == 0);
                        raster.SetValue(b, x, y, none ? c.noData : 1 + Pattern(x, y, b + 1));
                    }
            writer.Write(raster);
            writer.Close();
        }
        std::unique_ptr<GDALDataset> ds(
            GDALDataset::Open(path.c_str(), GDAL_OF_RASTER | GDAL_OF_READONLY));
        ASSERT_TRUE(ds != nullptr);
        std::vector<GByte> mask(static_cast<std::size_t>(width) * height);
        ASSERT_EQ(ds->GetRasterBand(1)->GetMaskBand()->RasterIO(
                      GF_Read, 0, 0, width, height, mask.data(), width, height, GDT_Byte, 0, 0,
                      nullptr),
                  CE_None);
        int wrong = 0;
        for (int y = 0; y < height; ++y)
            for (int x = 0; x < width; ++x)
                wrong += mask[y * width + x] !=
                         (empty(x, y) && c.channelsWithNoData == 3 ? 0 : 255);
        EXPECT_EQ(wrong, 0);
    }
}

TEST(RasterWriter, WithoutCloseTheFinalNameIsUntouched) {
    TempDir dir;
    const std::string path = dir.File("ortho.tif");
    testsupport::WriteFile(path, "previous");
    for (const char* type : {"tif", "cog"}) {
        std::unique_ptr<IRasterWriter> writer(GetRasterWriter(path, type, {1, 2, 3}));
        WriteOrtho(*writer);
    }
    EXPECT_EQ(testsupport::ReadFile(path), "previous");
    EXPECT_EQ(std::distance(std::filesystem::directory_iterator(dir.Path()),
                            std::filesystem::directory_iterator()),
              1);
}

// A dataset with side files (a PNG's .aux.xml with its CRS, its world file) is published whole:
// a rename that fails half-way puts the older dataset back and leaves no temporary; a side file
// the newer dataset does not have goes.
TEST(RasterWriter, SideFilesArePublishedWithTheirDatasetOrNotAtAll) {
    TempDir dir;
    const std::string png = dir.File("ortho.png");
    auto write = [&](const char* options) {
        BasicWriter writer(png, {1, 2, 3}, "PNG", options);
        WriteOrtho(writer);
        writer.Close();
    };
    auto files = [&] {
        std::set<std::string> names;
        for (const auto& entry : std::filesystem::directory_iterator(dir.Path()))
            names.insert(entry.path().filename().string());
        return names;
    };
    write("WORLDFILE=NO");
    const std::string image = testsupport::ReadFile(png);
    const std::string aux = testsupport::ReadFile(png + ".aux.xml");
    ASSERT_EQ(files(), (std::set<std::string>{"ortho.png", "ortho.png.aux.xml"}));

    // The world file's name is taken by a directory: its rename fails.
    std::filesystem::create_directories(dir.Path() / "ortho.wld" / "inside");
    if (const auto e = Thrown<kestrel::FileAccessException>([&] { write("WORLDFILE=YES"); })) {
        EXPECT_EQ(e->GetFileName(), png);
        EXPECT_TRUE(Contains(e->what(), "ortho.wld")) << e->what();
    }
    EXPECT_EQ(files(), (std::set<std::string>{"ortho.png", "ortho.png.aux.xml", "ortho.wld"}));
    EXPECT_EQ(testsupport::ReadFile(png), image);
    EXPECT_EQ(testsupport::ReadFile(png + ".aux.xml"), aux);

    std::filesystem::remove_all(dir.Path() / "ortho.wld");
    write("WORLDFILE=YES");
    EXPECT_EQ(files(), (std::set<std::string>{"ortho.png", "ortho.png.aux.xml", "ortho.wld"}));
    write("WORLDFILE=NO");
    EXPECT_EQ(files(), (std::set<std::string>{"ortho.png", "ortho.png.aux.xml"}));
}

TEST(RasterWriter, FailuresNameTheFileAndLeaveNothing) {
    TempDir dir;
    // A directory that cannot be written (skipped where permissions do not apply, as for root).
    const auto locked = dir.Path() / "locked";
    std::filesystem::create_directory(locked);
    std::filesystem::permissions(
        locked, std::filesystem::perms::owner_read | std::filesystem::perms::owner_exec);
    if (!testsupport::WriteFile((locked / "probe").string(), "x").empty() &&
        std::filesystem::exists(locked / "probe")) {
        std::filesystem::remove(locked / "probe");
    } else {
        const std::string path = (locked / "ortho.tif").string();
        std::unique_ptr<IRasterWriter> writer(GetRasterWriter(path, "tif", {1}));
        writer->SetSize(16, 16);
        writer->SetDataType(DataType::Byte);
        if (const auto e = Thrown<kestrel::FileAccessException>([&] { writer->Create(); })) {
            EXPECT_EQ(e->GetFileName(), path);
            EXPECT_EQ(e->GetType(), kestrel::FileAccessException::CreateFailed);
        }
    }
    std::filesystem::permissions(locked, std::filesystem::perms::owner_all);
    // PNG cannot hold floating-point values: the copy on close fails, and no file is left.
    const std::string png = dir.File("ortho.png");
    {
        std::unique_ptr<IRasterWriter> writer(GetRasterWriter(png, "png", {1}));
        writer->SetSize(16, 16);
        writer->SetDataType(DataType::Float64);
        const auto e = Thrown<kestrel::FileAccessException>([&] { writer->Close(); });
        EXPECT_EQ(e ? e->GetFileName() : "", png);
    }
    EXPECT_TRUE(std::filesystem::is_empty(dir.Path() / "locked"));
    std::filesystem::remove(dir.Path() / "locked");
    EXPECT_TRUE(std::filesystem::is_empty(dir.Path()));
    // A directory that does not exist.
    EXPECT_TRUE(Contains(ThrownMessage<kestrel::FileAccessException>([&] {
                             std::unique_ptr<IRasterWriter> writer(
                                 GetRasterWriter(dir.File("no/such/dir/o.tif"), "tif", {1}));
                             writer->SetSize(16, 16);
                             writer->SetDataType(DataType::Byte);
                             writer->Create();
                         }),
                         "no/such/dir/o.tif"));
    // Unknown types and formats.
    if (const auto e = Thrown<kestrel::ParameterException>(
            [&] { delete GetRasterWriter(dir.File("a.xyz1"), "xyz1", {1}); })) {
        EXPECT_EQ(e->GetType(), kestrel::ParameterException::Unsupported);
        EXPECT_EQ(e->GetValue(), "xyz1");
        EXPECT_TRUE(Contains(e->GetExpected(), "gpkg"));
    }
}

// ---------------------------------------------------------------------------------------------
// What the utility functions pass to the raster components

namespace {

// Records the raster components' calls as texts, in order.
class Recorder : public kestrel::datasources::RasterIOObserver {
  public:
    void ReaderCreated(const IRasterReader* reader, const std::string& /*path*/,
                       const std::vector<unsigned int>& channels) override {
        Add("reader " + Channels(channels), reader);
    }
    void WindowRead(const IRasterReader* reader, unsigned int x, unsigned int y, unsigned int w,
                    unsigned int h, const Raster* result) override {
        Add("read " + std::to_string(x) + "," + std::to_string(y) + "," + std::to_string(w) + "," +
                std::to_string(h),
            reader);
        lastRead = result;
    }
    void WriterCreated(const IRasterWriter* writer, const std::string& /*path*/,
                       const std::vector<unsigned int>& channels, const std::string& format,
                       const std::string& options) override {
        Add("writer " + Channels(channels) + " " + format + " [" + options + "]", writer);
    }
    void FormatNameLookedUp(const std::string& fileType, const std::string& format) override {
        Add("lookup " + fileType + " " + format, nullptr);
    }
    void RasterDeleted(const Raster* raster) override {
        if (raster == lastRead)
            Add("deleted the read raster", nullptr);
    }

    std::vector<std::string> events;
    std::vector<const void*> subjects;
    const Raster* lastRead = nullptr;

  private:
    static std::string Channels(const std::vector<unsigned int>& channels) {
        std::string text;
        for (unsigned int c : channels)
            text += (text.empty() ? "" : ",") + std::to_string(c);
        return "{" + text + "}";
    }
    void Add(const std::string& event, const void* subject) {
        events.push_back(event);
        subjects.push_back(subject);
    }
};

}  // namespace

TEST(RasterUtils, ReadersAreProbedOnceAtTheFirstPixelAndTheProbeIsDeleted) {
    TempDir dir;
    const std::string path = MakeImage(dir, "a.tif", ImageSpec());
    std::unique_ptr<IDataset> ds(GetRasterDataset(path));
    auto recorder = std::make_shared<Recorder>();
    kestrel::datasources::ScopedRasterIOObserver scope(recorder);
    std::unique_ptr<IRasterReader> onFile(GetRasterReader(path));
    std::unique_ptr<IRasterReader> onDataset(GetRasterReader(ds.get(), {2, 3}));
    EXPECT_EQ(recorder->events, (std::vector<std::string>{
                                    "reader {1,2,3}", "read 0,0,1,1", "deleted the read raster",
                                    "reader {2,3}", "read 0,0,1,1", "deleted the read raster"}));
    EXPECT_EQ(recorder->subjects[1], onFile.get());
    EXPECT_EQ(recorder->subjects[4], onDataset.get());
}

TEST(RasterUtils, WritersGetTheFormatNameFirstAndNoProbe) {
    TempDir dir;
    auto recorder = std::make_shared<Recorder>();
    kestrel::datasources::ScopedRasterIOObserver scope(recorder);
    std::unique_ptr<IRasterWriter> typed(GetRasterWriter(dir.File("o.tif"), "TIF", {1, 2}));
    std::unique_ptr<IRasterWriter> plain(GetRasterWriter(dir.File("p.tif")));
    EXPECT_EQ(recorder->events, (std::vector<std::string>{
                                    "lookup TIF GTiff", "writer {1,2} GTiff []", "writer {}  []"}));
    EXPECT_EQ(dynamic_cast<BasicWriter*>(plain.get())->GetFormatName(), "GTiff");
}

TEST(RasterUtils, FileTypesNameGdalFormats) {
    const std::vector<std::pair<std::string, std::string>> table = {
        {"tif", "GTiff"}, {"TIFF", "GTiff"},  {"cog", "COG"},       {"vrt", "VRT"},
        {"img", "HFA"},   {"Gpkg", "GPKG"},   {"png", "PNG"},       {"jpg", "JPEG"},
        {"JPEG", "JPEG"}, {"hdr", "ENVI"},    {"envi", "ENVI"},     {"ntf", "NITF"},
        {"mem", "MEM"},   {"GTiff", "GTiff"}, {"netcdf", "netCDF"}, {"SAGA", "SAGA"}};
    for (const auto& [type, format] : table)
        EXPECT_EQ(kestrel::core::FType2FormatName(type), format) << type;
    const std::vector<std::pair<std::string, std::string>> extensions = {
        {"GTiff", "tif"}, {"COG", "tif"}, {"HFA", "img"}, {"GPKG", "gpkg"},
        {"PNG", "png"},   {"JPEG", "jpg"}, {"MEM", ""}};
    for (const auto& [format, extension] : extensions)
        EXPECT_EQ(kestrel::core::FileExtension(format), extension) << format;
    for (const std::string& type :
         std::vector<std::string>{"", "tiff2", "ESRI Shapefile", std::string("tif\0x", 5)}) {
        if (const auto e = Thrown<kestrel::ParameterException>(
                [&] { kestrel::core::FType2FormatName(type); }, type)) {
            EXPECT_EQ(e->GetType(), kestrel::ParameterException::Unsupported);
            EXPECT_EQ(e->GetValue(), type);
            EXPECT_TRUE(Contains(e->what(), "tif, tiff")) << e->what();
        }
    }
}

TEST(RasterUtils, SourceAndOrthoChannelsOfOneDataType) {
    TempDir dir;
    std::unique_ptr<IDataset> ds(GetRasterDataset(MakeTypedBands(dir, {GDT_Byte, GDT_UInt16, GDT_Byte})));
    std::vector<unsigned int> src{9};
    std::vector<unsigned int> ortho{8, 7};
    GetSrcOrthoChans(ds.get(), {3, 1}, src, ortho);
    EXPECT_EQ(src, (std::vector<unsigned int>{3, 1}));
    EXPECT_EQ(ortho, (std::vector<unsigned int>{1, 2}));
    if (const auto e = Thrown<kestrel::DataException>([&] {
            GetSrcOrthoChans(ds.get(), {1, 2}, src, ortho);
        })) {
        EXPECT_EQ(e->GetErrorMessage(),
                  "All channels must belong to the same datatype, but 2 data types are found.");
        EXPECT_EQ(e->GetSourceFile(), "utils.cpp");
    }
    EXPECT_EQ(src, (std::vector<unsigned int>{3, 1}));
    EXPECT_EQ(ortho, (std::vector<unsigned int>{1, 2}));
    // GetChanGroups itself: groups by type in order, an empty list for every channel, ortho
    // channels numbered in the group or across the list.
    std::vector<SrcChanInfo> infos;
    std::vector<ChanGroup> groups;
    GetChanGroups("", {}, ds.get(), infos, groups, false);
    ASSERT_EQ(groups.size(), 2u);
    EXPECT_EQ(groups[0].srcChans, (std::vector<unsigned int>{1, 3}));
    EXPECT_EQ(groups[0].orthoChans, (std::vector<unsigned int>{1, 2}));
    EXPECT_EQ(groups[1].srcChans, (std::vector<unsigned int>{2}));
    EXPECT_EQ(groups[1].dataType, DataType::UInt16);
    EXPECT_EQ(infos.size(), 3u);
    GetChanGroups("", {2, 1, 3}, ds.get(), infos, groups, true);
    EXPECT_EQ(groups[1].orthoChans, (std::vector<unsigned int>{2, 3}));
    const std::string zero = ThrownMessage<kestrel::DataException>([&] {
        GetSrcOrthoChans(ds.get(), {1, 0}, src, ortho);
    });
    EXPECT_TRUE(Contains(zero, "Channel 0") && Contains(zero, "3 channels")) << zero;
}

TEST(RasterUtils, DiskIdIsTheDeviceOfTheFile) {
    TempDir dir;
    const std::string a = testsupport::WriteFile(dir.File("a.txt"), "a");
    const std::string b = testsupport::WriteFile(dir.File("b.txt"), "b");
    EXPECT_NE(GetDiskId(a), 0u);
    EXPECT_EQ(GetDiskId(a), GetDiskId(b));
    EXPECT_EQ(GetDiskId(dir.File("missing.txt")), 0u);
    EXPECT_EQ(GetDiskId(""), 0u);
}

#if !defined(_WIN32)
// A disk that fills up while the ortho is written (a file size limit stands in for it): the
// failure is reported with the file's name and nothing is left under either name.
TEST(RasterWriter, DiskFullLeavesNoPartialFile) {
    TempDir dir;
    const std::string path = dir.File("big.tif");
    rlimit before{};
    getrlimit(RLIMIT_FSIZE, &before);
    const auto previous = std::signal(SIGXFSZ, SIG_IGN);
    rlimit limit = before;
    limit.rlim_cur = 200000;
    ASSERT_EQ(setrlimit(RLIMIT_FSIZE, &limit), 0);
    bool failed = false;
    try {
        std::unique_ptr<IRasterWriter> writer(
            new BasicWriter(path, {1, 2, 3}, "GTiff", "COMPRESS=NONE"));
        writer->SetSize(512, 512);
        writer->SetDataType(DataType::Byte);
        Raster tile(512, 512, 3, DataType::Byte);
        tile.Fill(7);
        writer->WriteWindow(tile, 0, 0);
        writer->Close();
    } catch (const kestrel::FileAccessException& e) {
        failed = true;
        EXPECT_EQ(e.GetFileName(), path);
    }
    setrlimit(RLIMIT_FSIZE, &before);
    std::signal(SIGXFSZ, previous);
    EXPECT_TRUE(failed);
    EXPECT_TRUE(std::filesystem::is_empty(dir.Path()));
}
#endif
