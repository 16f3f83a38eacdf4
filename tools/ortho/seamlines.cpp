#include "seamlines.h"

#include "files.h"

#include <kestrel/exception.h>

#include <gdal_alg.h>
#include <gdal_priv.h>
#include <ogrsf_frmts.h>

#include <algorithm>
#include <functional>
#include <memory>

namespace ortho {

namespace {

constexpr const char* kLayer = "seamlines";
constexpr const char* kSceneField = "scene";

std::string Where(const std::string& path) {
    return "--seamlines: " + path + ", layer \"" + kLayer + "\"";
}

// Polygons, multi-polygons and their curved kinds (an editor may draw arcs).
bool Areal(OGRwkbGeometryType type) {
    return OGR_GT_IsSurface(type) || OGR_GT_IsSubClassOf(type, wkbMultiSurface);
}

// The layer "seamlines" of the file, checked to hold polygons with a CRS and the scene field.
OGRLayer* OpenLayer(const std::string& path, DatasetPtr& dataset, const ErrorCapture& errors) {
    dataset.reset(
        GDALDataset::Open(path.c_str(), GDAL_OF_VECTOR | GDAL_OF_READONLY, nullptr, nullptr));
    if (!dataset)
        throw UsageError("--seamlines: " + path + ": cannot be opened as a vector file: " +
                         errors.Reason());
    OGRLayer* layer = dataset->GetLayerByName(kLayer);
    if (layer == nullptr) {
        std::string names;
        for (int i = 0; i < dataset->GetLayerCount(); ++i)
            names += std::string(names.empty() ? "" : ", ") + dataset->GetLayer(i)->GetName();
        throw UsageError("--seamlines: " + path + ": no layer \"" + kLayer + "\" (" +
                         (names.empty() ? std::string("no layers") : "layers: " + names) + ")");
    }
    const OGRwkbGeometryType type = wkbFlatten(layer->GetGeomType());
    if (!Areal(type) && type != wkbUnknown)
        throw UsageError(Where(path) + ": holds " + OGRGeometryTypeToName(type) +
                         " geometries, not polygons");
    if (layer->GetSpatialRef() == nullptr)
        throw UsageError(Where(path) + ": the layer has no coordinate system");
    if (layer->GetLayerDefn()->GetFieldIndex(kSceneField) < 0)
        throw UsageError(Where(path) + ": the layer has no field \"" + kSceneField +
                         "\" naming each polygon's scene");
    return layer;
}

using Region = std::unique_ptr<OGRGeometry>;

// Calls use(feature id, scene name, polygon in the layer's CRS) for each feature with a
// geometry, in the layer's order; a feature whose geometry is not a polygon throws.
void ForEachRegion(const std::string& path, const ErrorCapture& errors,
                   const std::function<void(GIntBig, const std::string&, Region)>& use) {
    DatasetPtr dataset;
    OGRLayer* layer = OpenLayer(path, dataset, errors);
    const int field = layer->GetLayerDefn()->GetFieldIndex(kSceneField);
    layer->ResetReading();
    while (OGRFeature* read = layer->GetNextFeature()) {
        const std::unique_ptr<OGRFeature> feature(read);
        Region shape(feature->StealGeometry());
        // A row without a shape (a table row added in an editor) covers nothing.
        if (!shape || shape->IsEmpty())
            continue;
        const OGRwkbGeometryType type = wkbFlatten(shape->getGeometryType());
        if (!Areal(type))
            throw UsageError(Where(path) + ", feature " + std::to_string(feature->GetFID()) +
                             ": a " + OGRGeometryTypeToName(type) + ", not a polygon");
        if (OGR_GT_IsNonLinear(type))
            shape.reset(shape->getLinearGeometry());
        if (shape->getSpatialReference() == nullptr)
            shape->assignSpatialReference(layer->GetSpatialRef());
        use(feature->GetFID(), feature->GetFieldAsString(field), std::move(shape));
    }
}

std::string UnknownScene(const std::string& path, GIntBig fid, const std::string& name,
                         const std::vector<std::string>& names) {
    std::string listed;
    for (const std::string& known : names)
        listed += (listed.empty() ? "" : ", ") + known;
    return Where(path) + ", feature " + std::to_string(fid) + ": scene \"" + name +
           "\" is not a scene of this run (" + listed + ")";
}

}  // namespace

void WriteSeamlines(const std::string& sourceRaster, const std::vector<RecoveryScene>& scenes,
                    const Grid& grid, const std::string& path) {
    ErrorCapture errors;
    DatasetPtr source(GDALDataset::Open(sourceRaster.c_str(), GDAL_OF_RASTER | GDAL_OF_READONLY,
                                        nullptr, nullptr));
    if (!source)
        FailFile(sourceRaster, "cannot be opened", errors);
    OGRSpatialReference srs = GridSrs(grid);

    // The regions as polygons of their pixels' edges, each with its value; 0 (no scene) left
    // out by using the band as its own mask.
    GDALDriver* memory = GetGDALDriverManager()->GetDriverByName("Memory");
    DatasetPtr traced(memory == nullptr
                          ? nullptr
                          : memory->Create("regions", 0, 0, 0, GDT_Unknown, nullptr));
    OGRLayer* regions =
        traced ? traced->CreateLayer("regions", nullptr, wkbPolygon, nullptr) : nullptr;
    OGRFieldDefn valueField("value", OFTInteger);
    if (regions == nullptr || regions->CreateField(&valueField) != OGRERR_NONE)
        FailFile(path, "cannot trace the regions", errors);
    GDALRasterBand* band = source->GetRasterBand(1);
    if (GDALPolygonize(band, band, regions, 0, nullptr, nullptr, nullptr) != CE_None)
        FailFile(sourceRaster, "its regions cannot be traced", errors);

    DatasetPtr written = CreateVector(path, errors);
    OGRLayer* layer = written->CreateLayer(kLayer, &srs, wkbPolygon, nullptr);
    if (layer == nullptr)
        FailFile(path, std::string("layer ") + kLayer + " cannot be created", errors);
    OGRFieldDefn fields[] = {{kSceneField, OFTString},
                             {"master_line", OFTInteger},
                             {"ortho", OFTString},
                             {"source", OFTString}};
    for (OGRFieldDefn& field : fields) {
        if (layer->CreateField(&field) != OGRERR_NONE)
            FailFile(path, std::string("the fields of layer ") + kLayer + " cannot be created",
                     errors);
    }
    if (written->StartTransaction() != OGRERR_NONE)
        FailFile(path, "cannot be written", errors);
    regions->ResetReading();
    while (OGRFeature* read = regions->GetNextFeature()) {
        const std::unique_ptr<OGRFeature> region(read);
        const int value = region->GetFieldAsInteger(0);
        if (value < 1 || static_cast<std::size_t>(value) > scenes.size())
            FailFile(sourceRaster, "holds value " + std::to_string(value) + ", which no scene has",
                     errors);
        const RecoveryScene& scene = scenes[static_cast<std::size_t>(value) - 1];
        const std::unique_ptr<OGRFeature> out(OGRFeature::CreateFeature(layer->GetLayerDefn()));
        out->SetField(kSceneField, scene.name.c_str());
        out->SetField("master_line", static_cast<int>(scene.masterLine));
        out->SetField("ortho", scene.ortho.c_str());
        out->SetField("source", scene.source.c_str());
        out->SetGeometry(region->GetGeometryRef());
        if (layer->CreateFeature(out.get()) != OGRERR_NONE)
            FailFile(path, "a region of " + scene.name + " cannot be written", errors);
    }
    if (written->CommitTransaction() != OGRERR_NONE)
        FailFile(path, "cannot be written", errors);
    written.reset();
    if (errors.Failed())
        FailFile(path, "cannot be written", errors);
}

void CheckSeamlines(const std::string& path) {
    ErrorCapture errors;
    DatasetPtr dataset;
    OpenLayer(path, dataset, errors);
}

void CheckSeamlineScenes(const std::string& path, const std::vector<std::string>& names) {
    ErrorCapture errors;
    ForEachRegion(path, errors, [&](GIntBig fid, const std::string& name, Region) {
        if (std::find(names.begin(), names.end(), name) == names.end())
            throw UsageError(UnknownScene(path, fid, name, names));
    });
}

void BurnSeamlines(const std::string& path, const std::vector<RecoveryScene>& scenes,
                   const std::vector<std::string>& others, const Grid& grid,
                   const std::string& raster, std::vector<std::string>& skipped) {
    ErrorCapture errors;
    OGRSpatialReference srs = GridSrs(grid);
    std::vector<Region> shapes;
    std::vector<double> values;
    ForEachRegion(path, errors, [&](GIntBig fid, const std::string& name, Region shape) {
        const auto scene = std::find_if(scenes.begin(), scenes.end(),
                                        [&](const RecoveryScene& s) { return s.name == name; });
        if (scene == scenes.end()) {
            if (std::find(others.begin(), others.end(), name) == others.end()) {
                std::vector<std::string> names = others;
                for (const RecoveryScene& s : scenes)
                    names.push_back(s.name);
                KESTREL_THROW(kestrel::DataException, UnknownScene(path, fid, name, names));
            }
            if (std::find(skipped.begin(), skipped.end(), name) == skipped.end())
                skipped.push_back(name);
            return;
        }
        if (shape->transformTo(&srs) != OGRERR_NONE)
            KESTREL_THROW(kestrel::DataException,
                          Where(path) + ", feature " + std::to_string(fid) +
                              ": cannot be transformed into the mosaic's coordinate system");
        shapes.push_back(std::move(shape));
        values.push_back(static_cast<double>(scene - scenes.begin() + 1));
    });

    // Values as the source raster holds them: Byte, UInt16 from 255 scenes on.
    DatasetPtr regions =
        CreateGridRaster(grid, raster, errors, scenes.size() < 255 ? GDT_Byte : GDT_UInt16);
    std::vector<OGRGeometryH> handles;
    for (const auto& shape : shapes)
        handles.push_back(OGRGeometry::ToHandle(shape.get()));
    int band = 1;
    // In the layer's order, so that later polygons replace earlier ones.
    if (!handles.empty() &&
        GDALRasterizeGeometries(GDALDataset::ToHandle(regions.get()), 1, &band,
                                static_cast<int>(handles.size()), handles.data(), nullptr,
                                nullptr, values.data(), nullptr, nullptr, nullptr) != CE_None)
        FailFile(path, "cannot be burnt into the grid", errors);
    regions->FlushCache();
    if (errors.Failed())
        FailFile(raster, "cannot be written", errors);
}

}  // namespace ortho
