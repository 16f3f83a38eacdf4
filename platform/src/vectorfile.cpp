#include <kestrel/vectorfile.h>

#include <cmath>
#include <cstring>
#include <string>
#include <utility>
#include <vector>

#include <cpl_conv.h>
#include <cpl_string.h>
#include <cpl_vsi.h>
#include <gdal_priv.h>
#include <ogrsf_frmts.h>

#include <kestrel/exception.h>

#include "factoryslot.h"
#include <kestrel/gdalsupport.h>

GDBFile::~GDBFile() = default;
GDBLayer_t::~GDBLayer_t() = default;

namespace kestrel {
namespace vectorfile {

VectorFileImpl::~VectorFileImpl() = default;

namespace {

// Why the last GDBOpen of this thread gave null, for the call that is handed the null.
struct OpenFailure {
    std::string path;
    std::string reason;
};
thread_local OpenFailure lastOpenFailure;

[[noreturn]] void ThrowNullHandle(const char* what, const SourceLocation& where) {
    if (lastOpenFailure.path.empty()) {
        KESTREL_THROW_AT(where, FileAccessException, "", FileAccessException::AccessFailed,
                         FormatString("%s was given a null handle: no vector file is open", what));
    }
    KESTREL_THROW_AT(
        where, FileAccessException, lastOpenFailure.path, FileAccessException::OpenFailed,
        FormatString("%s was given a null handle: \"%s\" could not be opened for "
                     "vector output: %s",
                     what, lastOpenFailure.path.c_str(), lastOpenFailure.reason.c_str()));
}

struct GdalCloser {
    void operator()(GDALDataset* dataset) const { GDALClose(dataset); }
};
using DatasetPtr = std::unique_ptr<GDALDataset, GdalCloser>;

class OgrLayer;

class OgrFile final : public GDBFile {
  public:
    OgrFile(std::string path, DatasetPtr dataset)
        : path_(std::move(path)), dataset_(std::move(dataset)) {}

    const std::string& Path() const { return path_; }
    GDALDataset& Dataset() { return *dataset_; }
    std::vector<std::unique_ptr<OgrLayer>>& Layers() { return layers_; }
    DatasetPtr Release() { return std::move(dataset_); }

  private:
    std::string path_;
    DatasetPtr dataset_;
    std::vector<std::unique_ptr<OgrLayer>> layers_;
};

class OgrLayer final : public GDBLayer_t {
  public:
    OgrLayer(OgrFile& file, OGRLayer& layer) : file_(file), layer_(layer) {}

    OgrFile& File() { return file_; }
    OGRLayer& Layer() { return layer_; }

    OGRFeature& Shape(int shape, const SourceLocation& where) {
        if (shape < 0 || static_cast<std::size_t>(shape) >= shapes_.size()) {
            KESTREL_THROW_AT(
                where, DataException,
                FormatString("Layer \"%s\" of \"%s\" has no shape %d (it has %zu)",
                             layer_.GetName(), file_.Path().c_str(), shape, shapes_.size()));
        }
        return *shapes_[static_cast<std::size_t>(shape)];
    }
    int AddShape() {
        shapes_.emplace_back(OGRFeature::CreateFeature(layer_.GetLayerDefn()));
        return static_cast<int>(shapes_.size() - 1);
    }
    // Writes the shapes made since the last store.
    void Store() {
        for (auto& shape : shapes_) {
            if (!shape)
                continue;
            gdalsupport::ErrorCapture errors;
            if (layer_.CreateFeature(shape.get()) != OGRERR_NONE) {
                KESTREL_THROW(
                    FileAccessException, file_.Path(), FileAccessException::WriteFailed,
                    FormatString("A shape of layer \"%s\" cannot be written to \"%s\": %s",
                                 layer_.GetName(), file_.Path().c_str(), errors.Reason().c_str()));
            }
            shape.reset();
        }
    }

  private:
    struct FeatureDeleter {
        void operator()(OGRFeature* feature) const { OGRFeature::DestroyFeature(feature); }
    };
    OgrFile& file_;
    OGRLayer& layer_;
    std::vector<std::unique_ptr<OGRFeature, FeatureDeleter>> shapes_;
};

template <typename Handle, typename Base>
Handle& Checked(Base* handle, const char* what, const SourceLocation& where) {
    if (handle == nullptr)
        ThrowNullHandle(what, where);
    auto* own = dynamic_cast<Handle*>(handle);
    if (own == nullptr) {
        KESTREL_THROW_AT(where, DataException,
                         FormatString("%s was given a handle that the vector-file functions did "
                                      "not make",
                                      what));
    }
    return *own;
}

std::string Text(const char* text) {
    return text != nullptr ? text : "";
}

bool IsDirectory(const std::string& path) {
    VSIStatBufL stat;
    return VSIStatL(path.c_str(), &stat) == 0 && VSI_ISDIR(stat.st_mode);
}

// A Shapefile datasource writes each layer as <directory>/<name>.shp; a file of that name that
// the datasource does not list would be truncated, so it counts as taken too.
bool NameTaken(OgrFile& file, const std::string& name) {
    if (file.Dataset().GetLayerByName(name.c_str()) != nullptr)
        return true;
    GDALDriver* driver = file.Dataset().GetDriver();
    if (driver == nullptr || !EQUAL(driver->GetDescription(), "ESRI Shapefile"))
        return false;
    const std::string directory =
        IsDirectory(file.Path()) ? file.Path() : std::string(CPLGetPath(file.Path().c_str()));
    VSIStatBufL stat;
    return VSIStatL(CPLFormFilename(directory.c_str(), name.c_str(), "shp"), &stat) == 0;
}

std::string UniqueName(OgrFile& file, const std::string& name) {
    if (!NameTaken(file, name))
        return name;
    for (int suffix = 2;; ++suffix) {
        const std::string candidate = name + "_" + std::to_string(suffix);
        if (!NameTaken(file, candidate))
            return candidate;
    }
}

// The coordinate system of the file's raster, else of its first layer that has one.
std::unique_ptr<OGRSpatialReference> FileCRS(OgrFile& file) {
    const OGRSpatialReference* srs = file.Dataset().GetSpatialRef();
    DatasetPtr raster;
    if (srs == nullptr) {
        gdalsupport::ErrorCapture quiet;
        raster.reset(GDALDataset::Open(file.Path().c_str(), GDAL_OF_RASTER | GDAL_OF_READONLY));
        if (raster)
            srs = raster->GetSpatialRef();
    }
    for (int i = 0; srs == nullptr && i < file.Dataset().GetLayerCount(); ++i)
        srs = file.Dataset().GetLayer(i)->GetSpatialRef();
    if (srs == nullptr)
        return nullptr;
    return std::unique_ptr<OGRSpatialReference>(srs->Clone());
}

OGRFieldType FieldType(int type, const SourceLocation& where) {
    switch (type) {
        case GDB_FIELD_INTEGER:
            return OFTInteger;
        case GDB_FIELD_INTEGER64:
            return OFTInteger64;
        case GDB_FIELD_REAL:
            return OFTReal;
        case GDB_FIELD_STRING:
            return OFTString;
        case GDB_FIELD_DATE:
            return OFTDate;
        default:
            KESTREL_THROW_AT(where, DataException,
                             FormatString("Unknown field type code %d: expected 0 (integer), 1 "
                                          "(64-bit integer), 2 (real), 3 (text) or 4 (date)",
                                          type));
    }
}

class OgrVectorFiles final : public VectorFileImpl {
  public:
    GDBFile* Open(const char* path, const char* mode) override {
        lastOpenFailure = OpenFailure{};
        const std::string name = Text(path);
        auto fail = [&](const std::string& reason) -> GDBFile* {
            lastOpenFailure = OpenFailure{name.empty() ? "(no path)" : name, reason};
            return nullptr;
        };
        if (name.empty())
            return fail("no path was given");
        if (Text(mode) != "r+")
            return fail(FormatString("mode \"%s\" is not supported: only \"r+\" (update)",
                                     Text(mode).c_str()));
        gdalsupport::EnsureRegistered();
        VSIStatBufL stat;
        if (VSIStatL(name.c_str(), &stat) != 0)
            return fail("no such file or directory");
        gdalsupport::ErrorCapture errors;
        DatasetPtr dataset(GDALDataset::Open(name.c_str(), GDAL_OF_VECTOR | GDAL_OF_UPDATE));
        if (!dataset) {
            GDALDriverH raster =
                GDALIdentifyDriverEx(name.c_str(), GDAL_OF_RASTER, nullptr, nullptr);
            if (raster != nullptr &&
                GDALIdentifyDriverEx(name.c_str(), GDAL_OF_VECTOR, nullptr, nullptr) == nullptr) {
                return fail(FormatString("a %s raster cannot hold vector layers",
                                         GDALGetDescription(raster)));
            }
            return fail(errors.Reason());
        }
        if (!dataset->TestCapability(ODsCCreateLayer)) {
            return fail(FormatString("the %s file cannot take new vector layers",
                                     dataset->GetDriver()->GetDescription()));
        }
        return new OgrFile(name, std::move(dataset));
    }

    GDBLayer_t* CreateLayer(GDBFile* handle, const char* category, const char* name,
                            const char* description) override {
        OgrFile& file = Checked<OgrFile>(handle, "GDBCreateLayer", KESTREL_HERE);
        const std::string base = Text(name).empty() ? "layer" : Text(name);
        const std::string unique = UniqueName(file, base);
        const auto srs = FileCRS(file);
        CPLStringList options;
        if (!Text(description).empty() &&
            EQUAL(file.Dataset().GetDriver()->GetDescription(), "GPKG"))
            options.SetNameValue("DESCRIPTION", description);
        gdalsupport::ErrorCapture errors;
        OGRLayer* layer =
            file.Dataset().CreateLayer(unique.c_str(), srs.get(), wkbPolygon25D, options.List());
        if (layer == nullptr) {
            KESTREL_THROW(
                FileAccessException, file.Path(), FileAccessException::WriteFailed,
                FormatString("Layer \"%s\" cannot be created in \"%s\": %s", unique.c_str(),
                             file.Path().c_str(), errors.Reason().c_str()));
        }
        if (!Text(category).empty())
            layer->SetMetadataItem("CATEGORY", category);
        file.Layers().push_back(std::make_unique<OgrLayer>(file, *layer));
        return file.Layers().back().get();
    }

    int AddField(GDBLayer_t* handle, const char* name, int type, GDBField* definition) override {
        OgrLayer& layer = Checked<OgrLayer>(handle, "GDBAddField", KESTREL_HERE);
        OGRFieldDefn field(Text(name).c_str(), FieldType(type, KESTREL_HERE));
        if (definition != nullptr) {
            field.SetWidth(definition->width);
            field.SetPrecision(definition->precision);
        }
        gdalsupport::ErrorCapture errors;
        if (Text(name).empty() || layer.Layer().CreateField(&field) != OGRERR_NONE) {
            KESTREL_THROW(
                FileAccessException, layer.File().Path(), FileAccessException::WriteFailed,
                FormatString("Field \"%s\" cannot be added to layer \"%s\" of \"%s\": %s",
                             Text(name).c_str(), layer.Layer().GetName(),
                             layer.File().Path().c_str(),
                             Text(name).empty() ? "the name is empty" : errors.Reason().c_str()));
        }
        return layer.Layer().GetLayerDefn()->GetFieldIndex(name);
    }

    int CreateShape(GDBLayer_t* handle, int id) override {
        OgrLayer& layer = Checked<OgrLayer>(handle, "GDBCreateShape", KESTREL_HERE);
        if (id != -1) {
            KESTREL_THROW(DataException,
                          FormatString("Shape id %d cannot be chosen by the caller: pass -1", id));
        }
        return layer.AddShape();
    }

    void SetVertices(GDBLayer_t* handle, int shape, int count, GDBVertex* vertices,
                     int* parts) override {
        OgrLayer& layer = Checked<OgrLayer>(handle, "GDBSetVertices", KESTREL_HERE);
        OGRFeature& feature = layer.Shape(shape, KESTREL_HERE);
        if (parts != nullptr)
            KESTREL_THROW(DataException, "Shapes of several rings are not supported: pass null");
        if (vertices == nullptr || count < 3) {
            KESTREL_THROW(DataException,
                          FormatString("A polygon needs at least 3 vertices; %d were given",
                                       vertices == nullptr ? 0 : count));
        }
        OGRLinearRing ring;
        for (int i = 0; i < count; ++i) {
            const GDBVertex& v = vertices[i];
            if (!std::isfinite(v.x) || !std::isfinite(v.y) || !std::isfinite(v.z)) {
                KESTREL_THROW(DataException,
                              FormatString("Vertex %d of a shape of \"%s\" is not finite (%g, %g, "
                                           "%g)",
                                           i, layer.File().Path().c_str(), v.x, v.y, v.z));
            }
            ring.addPoint(v.x, v.y, v.z);
        }
        ring.closeRings();
        OGRPolygon polygon;
        polygon.addRing(&ring);
        feature.SetGeometry(&polygon);
    }

    void SetValueString(GDBLayer_t* handle, int shape, int field, const char* value) override {
        OgrLayer& layer = Checked<OgrLayer>(handle, "GDBSetValueString", KESTREL_HERE);
        OGRFeature& feature = layer.Shape(shape, KESTREL_HERE);
        if (field < 0 || field >= feature.GetFieldCount()) {
            KESTREL_THROW(DataException, FormatString("Layer \"%s\" of \"%s\" has no field %d",
                                                      layer.Layer().GetName(),
                                                      layer.File().Path().c_str(), field));
        }
        feature.SetField(field, Text(value).c_str());
    }

    void Close(GDBFile* handle) override {
        std::unique_ptr<OgrFile> file(&Checked<OgrFile>(handle, "GDBClose", KESTREL_HERE));
        GDALDataset& dataset = file->Dataset();
        const bool transaction = dataset.StartTransaction() == OGRERR_NONE;
        try {
            for (auto& layer : file->Layers())
                layer->Store();
        } catch (...) {
            if (transaction)
                dataset.RollbackTransaction();
            throw;
        }
        gdalsupport::ErrorCapture errors;
        if (transaction && dataset.CommitTransaction() != OGRERR_NONE) {
            KESTREL_THROW(FileAccessException, file->Path(), FileAccessException::WriteFailed,
                          FormatString("The shapes cannot be stored in \"%s\": %s",
                                       file->Path().c_str(), errors.Reason().c_str()));
        }
        file->Layers().clear();
        file->Release().reset();
        if (errors.Failed()) {
            KESTREL_THROW(FileAccessException, file->Path(), FileAccessException::WriteFailed,
                          FormatString("\"%s\" cannot be closed: %s", file->Path().c_str(),
                                       errors.Reason().c_str()));
        }
    }
};

FactorySlot<VectorFileImpl>& Slot() {
    static FactorySlot<VectorFileImpl> slot(std::make_shared<OgrVectorFiles>());
    return slot;
}

std::shared_ptr<VectorFileImpl> Current() {
    return Slot().Current();
}

}  // namespace

std::shared_ptr<VectorFileImpl> GetDefaultImplementation() {
    return Slot().BuiltIn();
}

std::shared_ptr<VectorFileImpl> SetImplementation(std::shared_ptr<VectorFileImpl> impl) {
    return Slot().Install(std::move(impl));
}

ScopedVectorFileImpl::ScopedVectorFileImpl(std::shared_ptr<VectorFileImpl> impl)
    : previous_(SetImplementation(std::move(impl))) {}

ScopedVectorFileImpl::~ScopedVectorFileImpl() {
    SetImplementation(std::move(previous_));
}

}  // namespace vectorfile
}  // namespace kestrel

using kestrel::vectorfile::Current;

GDBFile* GDBOpen(const char* path, const char* mode) {
    return Current()->Open(path, mode);
}

GDBLayer_t* GDBCreateLayer(GDBFile* file, const char* category, const char* name,
                           const char* description) {
    return Current()->CreateLayer(file, category, name, description);
}

int GDBAddField(GDBLayer_t* layer, const char* name, int type, GDBField* definition) {
    return Current()->AddField(layer, name, type, definition);
}

int GDBCreateShape(GDBLayer_t* layer, int id) {
    return Current()->CreateShape(layer, id);
}

void GDBSetVertices(GDBLayer_t* layer, int shape, int count, GDBVertex* vertices, int* parts) {
    Current()->SetVertices(layer, shape, count, vertices, parts);
}

void GDBSetValueString(GDBLayer_t* layer, int shape, int field, const char* value) {
    Current()->SetValueString(layer, shape, field, value);
}

void GDBClose(GDBFile* file) {
    Current()->Close(file);
}
