// Vector files: layers of shapes with attribute fields, added to an existing file that can hold
// vector layers (a GeoPackage, which can hold an ortho raster and its footprint side by side, or
// a directory of Shapefiles).
//
// The calls and their order:
//   GDBFile* file = GDBOpen(path, "r+");
//   GDBLayer_t* layer = GDBCreateLayer(file, "Ortho", "Footprint", "");
//   int field = GDBAddField(layer, "Name", GDB_FIELD_STRING, nullptr);
//   int shape = GDBCreateShape(layer, -1);
//   GDBSetVertices(layer, shape, count, vertices, nullptr);
//   GDBSetValueString(layer, shape, field, "scene.gpkg");
//   GDBClose(file);   // stores the shapes and closes the file
//
// Failures throw the kestrel exceptions. GDBOpen alone reports by result: it returns null when
// the file cannot be opened for update or cannot hold vector layers, and remembers why (per
// thread); the next vector-file call given that null handle throws FileAccessException naming
// the path and the reason. Nothing has been written by then.
#pragma once

#include <memory>

#include <kestrel/export.h>

// One vertex of a shape: x, y and z, in this order, in the layer's coordinate system.
struct GDBVertex {
    double x;
    double y;
    double z;
};

// An opened vector file. Made by GDBOpen (or by an installed implementation), released by
// GDBClose.
class KESTREL_API GDBFile {
  public:
    virtual ~GDBFile();
    GDBFile(const GDBFile&) = delete;
    GDBFile& operator=(const GDBFile&) = delete;

  protected:
    GDBFile() = default;
};

// A layer of an opened vector file; it belongs to the file and goes with GDBClose.
class KESTREL_API GDBLayer_t {
  public:
    virtual ~GDBLayer_t();
    GDBLayer_t(const GDBLayer_t&) = delete;
    GDBLayer_t& operator=(const GDBLayer_t&) = delete;

  protected:
    GDBLayer_t() = default;
};

// Further properties of a new field (width, precision). Null takes the defaults of its type.
struct GDBField {
    int width;
    int precision;
};

// Field type codes of GDBAddField.
enum GDBFieldType : int {
    GDB_FIELD_INTEGER = 0,  // 32-bit integer
    GDB_FIELD_INTEGER64 = 1,
    GDB_FIELD_REAL = 2,    // double
    GDB_FIELD_STRING = 3,  // text
    GDB_FIELD_DATE = 4
};

// Opens an existing file for vector output. mode "r+" (update) is the only mode: any other
// gives null, as does a missing file or one that cannot hold vector layers (a GeoTIFF, a
// read-only file).
KESTREL_API GDBFile* GDBOpen(const char* path, const char* mode);

// A new layer of polygons. category is recorded as the layer's "CATEGORY" metadata item
// (empty: none); name is the layer's name, made unique in the file by a suffix "_2", "_3", ...
// so that earlier layers are never replaced; description is the layer's description (empty:
// none). The layer takes the coordinate system of the file's raster, else of its first layer
// that has one, else none.
KESTREL_API GDBLayer_t* GDBCreateLayer(GDBFile* file, const char* category, const char* name,
                                       const char* description);

// Adds an attribute field of a GDBFieldType; returns its index.
KESTREL_API int GDBAddField(GDBLayer_t* layer, const char* name, int type, GDBField* definition);

// A new shape of the layer; id -1 lets the layer number it (the only id accepted). Returns the
// shape's id. Shapes are stored by GDBClose.
KESTREL_API int GDBCreateShape(GDBLayer_t* layer, int id);

// Sets the vertices of a shape: one polygon ring, given closed (the last vertex repeats the first)
// or open (it is closed here), of at least three distinct vertices. parts must be null (one
// ring); shapes of several rings are not supported.
KESTREL_API void GDBSetVertices(GDBLayer_t* layer, int shape, int count, GDBVertex* vertices,
                                int* parts);

// Sets a text field of a shape.
KESTREL_API void GDBSetValueString(GDBLayer_t* layer, int shape, int field, const char* value);

// Stores the shapes of every layer of the file and closes it; the handle is gone afterwards.
KESTREL_API void GDBClose(GDBFile* file);

namespace kestrel {
namespace vectorfile {

// The implementation behind the GDB functions: the built-in one on OGR, or one that a test
// installs to see the calls and their arguments. The handles an implementation returns are
// passed back to it alone.
class KESTREL_API VectorFileImpl {
  public:
    virtual ~VectorFileImpl();
    virtual GDBFile* Open(const char* path, const char* mode) = 0;
    virtual GDBLayer_t* CreateLayer(GDBFile* file, const char* category, const char* name,
                                    const char* description) = 0;
    virtual int AddField(GDBLayer_t* layer, const char* name, int type, GDBField* definition) = 0;
    virtual int CreateShape(GDBLayer_t* layer, int id) = 0;
    virtual void SetVertices(GDBLayer_t* layer, int shape, int count, GDBVertex* vertices,
                             int* parts) = 0;
    virtual void SetValueString(GDBLayer_t* layer, int shape, int field, const char* value) = 0;
    virtual void Close(GDBFile* file) = 0;

  protected:
    VectorFileImpl() = default;
    VectorFileImpl(const VectorFileImpl&) = default;
    VectorFileImpl& operator=(const VectorFileImpl&) = default;
};

// The built-in implementation on OGR.
KESTREL_API std::shared_ptr<VectorFileImpl> GetDefaultImplementation();
// Installs impl (null restores the built-in one) and returns the one it replaces. Not meant to
// be called while another thread uses the vector-file functions.
KESTREL_API std::shared_ptr<VectorFileImpl> SetImplementation(std::shared_ptr<VectorFileImpl> impl);

// Installs an implementation for its own lifetime and restores the previous one after.
class KESTREL_API ScopedVectorFileImpl {
  public:
    explicit ScopedVectorFileImpl(std::shared_ptr<VectorFileImpl> impl);
    ~ScopedVectorFileImpl();
    ScopedVectorFileImpl(const ScopedVectorFileImpl&) = delete;
    ScopedVectorFileImpl& operator=(const ScopedVectorFileImpl&) = delete;

  private:
    std::shared_ptr<VectorFileImpl> previous_;
};

}  // namespace vectorfile
}  // namespace kestrel
