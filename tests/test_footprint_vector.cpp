// Footprints written as vector layers: the call sequence, and the files on OGR (ogrinfo as the
// oracle).
#include <gtest/gtest.h>

#include <cstdio>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include <gdal_priv.h>
#include <ogr_spatialref.h>

#include <kestrel/exception.h>
#include <kestrel/vectorfile.h>
#include <silvan/utils.h>

#include "program.h"


using kestrel::tin::Polygon;
using testsupport::ReadFile;
using testsupport::RunCommand;
using testsupport::TempDir;

namespace {


std::unique_ptr<Polygon<double>> Square(unsigned int points = 4) {
    const point2_t<double> corners[] = {
        {514700, 5033700}, {514800, 5033700}, {514800, 5033800}, {514700, 5033800}};
    auto* array = new point2_t<double>[points];
    for (unsigned int i = 0; i < points; ++i)
        array[i] = corners[i % 4];
    return std::make_unique<Polygon<double>>(array, points);
}

// A GeoPackage holding a small ortho raster in UTM 32N.
std::string OrthoGeoPackage(const TempDir& dir, const std::string& name) {
    GDALAllRegister();
    const std::string path = dir.File(name);
    GDALDriver* gpkg = GetGDALDriverManager()->GetDriverByName("GPKG");
    std::unique_ptr<GDALDataset> ds(gpkg->Create(path.c_str(), 16, 16, 1, GDT_Byte, nullptr));
    double gt[6] = {514700, 10, 0, 5033860, 0, -10};
    ds->SetGeoTransform(gt);
    OGRSpatialReference utm;
    utm.importFromEPSG(32632);
    ds->SetSpatialRef(&utm);
    std::vector<unsigned char> zeros(256, 0);
    EXPECT_EQ(ds->GetRasterBand(1)->RasterIO(GF_Write, 0, 0, 16, 16, zeros.data(), 16, 16, GDT_Byte,
                                             0, 0),
              CE_None);
    return path;
}

// Records the vector-file calls; optionally fails one of them.
class RecordingVectorFiles final : public kestrel::vectorfile::VectorFileImpl {
  public:
    struct File : GDBFile {};
    struct Layer : GDBLayer_t {};

    std::vector<std::string> calls;
    std::vector<GDBVertex> vertices;
    std::string failAt;

    GDBFile* Open(const char* path, const char* mode) override {
        Note("Open " + std::string(path) + " " + mode);
        return &file;
    }
    GDBLayer_t* CreateLayer(GDBFile* f, const char* a, const char* b, const char* c) override {
        Note(std::string("CreateLayer ") + (f == &file ? "file" : "?") + " " + a + "|" + b + "|" +
             c);
        return &layer;
    }
    int AddField(GDBLayer_t* l, const char* name, int type, GDBField* definition) override {
        Note(std::string("AddField ") + (l == &layer ? "layer" : "?") + " " + name + " " +
             std::to_string(type) + (definition == nullptr ? " null" : " defn"));
        return 7;
    }
    int CreateShape(GDBLayer_t*, int id) override {
        Note("CreateShape " + std::to_string(id));
        return 3;
    }
    void SetVertices(GDBLayer_t*, int shape, int count, GDBVertex* v, int* parts) override {
        Note("SetVertices " + std::to_string(shape) + " " + std::to_string(count) +
             (parts == nullptr ? " null" : " parts"));
        vertices.assign(v, v + count);
    }
    void SetValueString(GDBLayer_t*, int shape, int field, const char* value) override {
        Note("SetValueString " + std::to_string(shape) + " " + std::to_string(field) + " " + value);
    }
    void Close(GDBFile* f) override { calls.push_back(f == &file ? "Close file" : "Close ?"); }

  private:
    void Note(const std::string& call) {
        calls.push_back(call);
        if (!failAt.empty() && call.rfind(failAt, 0) == 0)
            KESTREL_THROW(kestrel::DataException, "refused by the test");
    }
    File file;
    Layer layer;
};

}  // namespace

TEST(WriteSceneFootprint, CallsTheVectorFileFunctionsInOrderWithTheRingClosed) {
    auto files = std::make_shared<RecordingVectorFiles>();
    kestrel::vectorfile::ScopedVectorFileImpl scoped(files);
    WriteSceneFootprint("d:\\orthos/scene.gpkg", Square().get());
    const std::vector<std::string> expected = {"Open d:\\orthos/scene.gpkg r+",
                                               "CreateLayer file Ortho|Footprint|",
                                               "AddField layer Name 3 null",
                                               "CreateShape -1",
                                               "SetVertices 3 5 null",
                                               "SetValueString 3 7 scene.gpkg",
                                               "Close file"};
    EXPECT_EQ(files->calls, expected);
    ASSERT_EQ(files->vertices.size(), 5u);
    EXPECT_EQ(files->vertices[4].x, files->vertices[0].x);
    EXPECT_EQ(files->vertices[4].y, files->vertices[0].y);
    for (const GDBVertex& v : files->vertices)
        EXPECT_EQ(v.z, 0.0);
}

TEST(WriteSceneFootprint, ClosesTheFileWhenACallFailsAndOpensNothingBelowFourPoints) {
    auto files = std::make_shared<RecordingVectorFiles>();
    kestrel::vectorfile::ScopedVectorFileImpl scoped(files);
    WriteSceneFootprint("scene.gpkg", Square(3).get());
    EXPECT_TRUE(files->calls.empty());

    files->failAt = "SetVertices";
    EXPECT_THROW(WriteSceneFootprint("scene.gpkg", Square().get()), kestrel::DataException);
    ASSERT_FALSE(files->calls.empty());
    EXPECT_EQ(files->calls.back(), "Close file");

    EXPECT_THROW(WriteSceneFootprint("scene.gpkg", nullptr), kestrel::DataException);
}

// Two calls on a GeoPackage holding the ortho leave two footprint layers in the raster's CRS,
// each with one closed polygon of numPoints + 1 vertices at z = 0 named after the file.
TEST(WriteSceneFootprint, AddsOneLayerPerCallToAGeoPackage) {
    TempDir dir;
    const std::string path = OrthoGeoPackage(dir, "scene.gpkg");
    WriteSceneFootprint(path, Square().get());
    WriteSceneFootprint(path, Square().get());
    const std::string layers = RunCommand("ogrinfo -q " + path);
    EXPECT_NE(layers.find("1: Footprint (3D Polygon)"), std::string::npos) << layers;
    EXPECT_NE(layers.find("2: Footprint_2 (3D Polygon)"), std::string::npos) << layers;
    for (const char* layer : {"Footprint", "Footprint_2"}) {
        const std::string info = RunCommand("ogrinfo -al " + path + " " + layer);
        EXPECT_NE(info.find("Feature Count: 1"), std::string::npos) << info;
        EXPECT_NE(info.find("UTM zone 32N"), std::string::npos) << info;
        EXPECT_NE(info.find("Name (String) = scene.gpkg"), std::string::npos) << info;
        EXPECT_NE(info.find("POLYGON Z ((514700 5033700 0,514800 5033700 0,514800 5033800 0,"
                            "514700 5033800 0,514700 5033700 0))"),
                  std::string::npos)
            << info;
    }
}

// A GeoTIFF cannot hold vector layers: the call reports it, naming the file and the reason,
// and leaves the file as it was. So does a missing file.
TEST(WriteSceneFootprint, RefusesAFileThatCannotHoldLayersAndLeavesItUnchanged) {
    TempDir dir;
    GDALAllRegister();
    const std::string tif = dir.File("ortho.tif");
    {
        std::unique_ptr<GDALDataset> ds(GetGDALDriverManager()->GetDriverByName("GTiff")->Create(
            tif.c_str(), 16, 16, 1, GDT_Byte, nullptr));
    }
    const std::string before = ReadFile(tif);
    for (const std::string& path : {tif, dir.File("missing.gpkg")}) {
        if (const auto e = testsupport::Thrown<kestrel::FileAccessException>(
                [&] { WriteSceneFootprint(path, Square().get()); }, path)) {
            EXPECT_EQ(e->GetFileName(), path);
            EXPECT_TRUE(testsupport::Contains(e->what(), path) &&
                        testsupport::Contains(e->what(), path == tif ? "cannot hold vector layers"
                                                                     : "no such file or directory"))
                << e->what();
        }
    }
    EXPECT_EQ(ReadFile(tif), before);
    EXPECT_FALSE(std::filesystem::exists(dir.File("missing.gpkg")));
}

// In a Shapefile directory each layer is a file of its own: the second call must not
// overwrite the first one's.
TEST(WriteSceneFootprint, AddsOneShapefilePerCallToADirectory) {
    TempDir dir;
    GDALAllRegister();
    {
        std::unique_ptr<GDALDataset> ds(
            GetGDALDriverManager()
                ->GetDriverByName("ESRI Shapefile")
                ->Create(dir.Path().string().c_str(), 0, 0, 0, GDT_Unknown, nullptr));
        ASSERT_NE(ds->CreateLayer("roads", nullptr, wkbLineString), nullptr);
    }
    WriteSceneFootprint(dir.Path().string(), Square().get());
    WriteSceneFootprint(dir.Path().string(), Square().get());
    for (const char* name : {"Footprint.shp", "Footprint_2.shp"}) {
        const std::string info = RunCommand("ogrinfo -al -so " + dir.File(name));
        EXPECT_NE(info.find("Feature Count: 1"), std::string::npos) << name << info;
    }
}
