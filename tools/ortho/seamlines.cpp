#include "seamlines.h"

#include "files.h"

#include <kestrel/exception.h>

#include <gdal_alg.h>
#include <gdal_priv.h>
#include <ogrsf_frmts.h>

#include <algorithm>
#include <array>
#include <functional>
#include <map>
#include <memory>
#include <stdexcept>
#include <string>
#include <unordered_map>
#include <vector>

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

// The regions of a class raster, 4-connected pixels of one value (0: none), as polygons with
// their holes, traced row by row along the pixels' edges. Each edge of a region's boundary is
// walked with the region on its right and followed, at its end, by the edge that the 2 x 2
// pixels around that corner give: straight on, or turning towards or away from the region;
// where two pixels of one value touch at a corner alone, the walk turns around each of them. So
// a ring closes when its last edge is linked, and memory holds the open boundaries, the closed
// rings (corners only) and two rows. `use` gets each region's value and polygon (pixel corners
// placed by `geo`), in the order of the regions' first pixels.
class RegionTracer {
public:
    // A row that cannot be read, or (a fault of the tracer) a boundary that does not close.
    struct Failure : std::runtime_error {
        using std::runtime_error::runtime_error;
    };

    RegionTracer(GDALRasterBand& band, const double* geo) : band_(band), geo_(geo) {}

    void Trace(const std::function<void(int, std::unique_ptr<OGRPolygon>)>& use) {
        const int width = band_.GetXSize(), height = band_.GetYSize();
        std::vector<GInt32> above(width, 0), below(width, 0);
        std::vector<int> aboveLabel(width, -1), belowLabel(width, -1);
        // The open chains by the position of their first or last edge: vertical edges of the
        // row above the line (down to it, up from it) and of the row below; horizontal ones on
        // the line, by their left end.
        std::vector<int> downIn(width + 1, -1), upOut(width + 1, -1);
        std::vector<int> downOut(width + 1, -1), upIn(width + 1, -1);
        std::vector<int> east(width, -1), west(width, -1);
        // Rows are read in strips of kStrip.
        constexpr int kStrip = 64;
        std::vector<GInt32> strip(static_cast<std::size_t>(width) * kStrip);
        for (int y = 0; y <= height; ++y) {
            if (y < height) {
                if (y % kStrip == 0) {
                    const int rows = std::min(kStrip, height - y);
                    if (band_.RasterIO(GF_Read, 0, y, width, rows, strip.data(), width, rows,
                                       GDT_Int32, 0, 0, nullptr) != CE_None)
                        throw Failure("rows " + std::to_string(y) + " to " +
                                      std::to_string(y + rows - 1) + " cannot be read");
                }
                const GInt32* row = strip.data() + static_cast<std::size_t>(y % kStrip) * width;
                std::copy(row, row + width, below.begin());
                // Runs of a value take one label; one that meets a run of its value above joins
                // that run's region (once a pair of runs).
                for (int x = 0; x < width; ++x) {
                    const bool sameRun = x > 0 && below[x] == below[x - 1];
                    if (below[x] == 0)
                        belowLabel[x] = -1;
                    else if (sameRun)
                        belowLabel[x] = belowLabel[x - 1];
                    else
                        belowLabel[x] = NewComponent(below[x]);
                    if (below[x] != 0 && above[x] == below[x] &&
                        !(sameRun && aboveLabel[x] == aboveLabel[x - 1]))
                        Join(belowLabel[x], aboveLabel[x]);
                }
            } else {
                std::fill(below.begin(), below.end(), 0);
                std::fill(belowLabel.begin(), belowLabel.end(), -1);
            }
            const auto at = [&](int x, int qx, int qy) {
                const int u = x + qx;
                return u < 0 || u >= width ? 0 : qy < 0 ? above[u] : below[u];
            };
            // The edges between a pixel of the row below and its left neighbour, and those
            // between it and the pixel above.
            for (int x = 0; x <= width; ++x) {
                const GInt32 left = x > 0 ? below[x - 1] : 0, right = x < width ? below[x] : 0;
                if (left != right && left != 0)
                    NewEdge(x, y, x, y + 1, belowLabel[x - 1], downOut[x]);
                if (left != right && right != 0)
                    NewEdge(x, y + 1, x, y, belowLabel[x], upIn[x]);
                if (x < width && above[x] != right && right != 0)
                    NewEdge(x, y, x + 1, y, belowLabel[x], east[x]);
                if (x < width && above[x] != right && above[x] != 0)
                    NewEdge(x + 1, y, x, y, aboveLabel[x], west[x]);
            }
            // At each corner of the line, every edge that ends there to the one that follows.
            for (int x = 0; x <= width; ++x) {
                if (downIn[x] < 0 && upIn[x] < 0 && (x == 0 || east[x - 1] < 0) &&
                    (x == width || west[x] < 0))
                    continue;  // no edge ends at this corner
                int none = -1;
                int* const in[4] = {&downIn[x], x > 0 ? &east[x - 1] : &none,
                                    x < width ? &west[x] : &none, &upIn[x]};
                int* const out[4] = {&downOut[x], x < width ? &east[x] : &none,
                                     x > 0 ? &west[x - 1] : &none, &upOut[x]};
                // Directions, in the order of `in` and `out`: down, east, west, up.
                static const int kStep[4][2] = {{0, 1}, {1, 0}, {-1, 0}, {0, -1}};
                for (int k = 0; k < 4; ++k) {
                    if (*in[k] < 0)
                        continue;
                    const int dx = kStep[k][0], dy = kStep[k][1];
                    const int rx = -dy, ry = dx;  // the region's side
                    auto pixel = [&](int ox, int oy) {
                        return at(x, ox > 0 ? 0 : -1, oy > 0 ? 0 : -1);
                    };
                    const GInt32 region = pixel(rx - dx, ry - dy);
                    int nx = dx, ny = dy;
                    bool pinch = false;  // the region's pixels touch at this corner alone
                    if (pixel(dx + rx, dy + ry) != region) {
                        nx = rx, ny = ry;
                        pinch = pixel(dx - rx, dy - ry) == region;
                    } else if (pixel(dx - rx, dy - ry) == region) {
                        nx = -rx, ny = -ry;
                    }
                    int next = -1;
                    for (int j = 0; j < 4; ++j)
                        if (kStep[j][0] == nx && kStep[j][1] == ny)
                            next = *out[j];
                    if (next < 0)
                        throw Failure("a region's boundary does not close");
                    Link(*in[k], next, pinch);
                }
            }
            std::swap(above, below);
            std::swap(aboveLabel, belowLabel);
            std::swap(downIn, downOut);
            std::swap(upOut, upIn);
            std::fill(downOut.begin(), downOut.end(), -1);
            std::fill(upIn.begin(), upIn.end(), -1);
            std::fill(east.begin(), east.end(), -1);
            std::fill(west.begin(), west.end(), -1);
        }
        // Each region: its outer ring (the one walked clockwise on the grid) and its holes.
        std::map<int, std::vector<std::size_t>> regions;
        for (std::size_t r = 0; r < rings_.size(); ++r)
            regions[Find(components_, rings_[r].component)].push_back(r);
        for (auto& [component, members] : regions) {
            std::stable_partition(members.begin(), members.end(),
                                  [&](std::size_t r) { return rings_[r].outer; });
            if (members.empty() || !rings_[members[0]].outer ||
                (members.size() > 1 && rings_[members[1]].outer))
                throw Failure("a region has other than one outer ring");
            auto polygon = std::make_unique<OGRPolygon>();
            for (std::size_t r : members)
                polygon->addRingDirectly(rings_[r].ring.release());
            use(values_[component], std::move(polygon));
        }
    }

private:
    struct Node {
        int x, y, next;
    };
    // A run of linked edges, its points a list of nodes. The slots of its first and last edges
    // (one slot for a single edge) hold its number until those edges are linked.
    struct Chain {
        int head, tail;  // nodes
        int* tailSlot;
        int component;
        bool pinched;  // passes a corner where its region's pixels touch alone
    };
    struct Ring {
        std::unique_ptr<OGRLinearRing> ring;
        int component;
        bool outer;
    };

    static int Find(std::vector<int>& parent, int i) {
        while (parent[i] != i)
            i = parent[i] = parent[parent[i]];
        return i;
    }
    int NewComponent(GInt32 value) {
        components_.push_back(static_cast<int>(components_.size()));
        values_.push_back(value);
        return components_.back();
    }
    // One component from two, under the first one's label.
    void Join(int a, int b) {
        a = Find(components_, a), b = Find(components_, b);
        if (a != b)
            components_[std::max(a, b)] = std::min(a, b);
    }
    int NewNode(int x, int y) {
        int n;
        if (!free_.empty()) {
            n = free_.back();
            free_.pop_back();
            nodes_[n] = {x, y, -1};
        } else {
            n = static_cast<int>(nodes_.size());
            nodes_.push_back({x, y, -1});
        }
        return n;
    }
    void NewEdge(int x0, int y0, int x1, int y1, int component, int& slot) {
        const int head = NewNode(x0, y0), tail = NewNode(x1, y1);
        nodes_[head].next = tail;
        if (!freeChains_.empty()) {
            slot = freeChains_.back();
            freeChains_.pop_back();
            chains_[slot] = {head, tail, &slot, component, false};
        } else {
            slot = static_cast<int>(chains_.size());
            chains_.push_back({head, tail, &slot, component, false});
        }
    }
    // Chain `a`, which ends at a corner, continued by chain `b`, which starts there; a ring
    // when they are one.
    void Link(int a, int b, bool pinch) {
        Chain& first = chains_[a];
        first.pinched = first.pinched || pinch;
        if (a == b) {
            Close(first);
            freeChains_.push_back(a);
            return;
        }
        Chain& second = chains_[b];
        const int shared = second.head;  // the corner, which `first` ends with already
        nodes_[first.tail].next = nodes_[shared].next;
        free_.push_back(shared);
        first.tail = second.tail;
        first.tailSlot = second.tailSlot;
        first.pinched = first.pinched || second.pinched;
        *first.tailSlot = a;
        freeChains_.push_back(b);
    }
    // A closed chain as rings of their corners (points where the boundary turns). Where a
    // region's pixels touch at a corner alone, the walk passes that corner twice: the ring is
    // cut there into simple rings (an outer ring and a hole, or two holes, that touch at a
    // point), as simple-feature polygons must be.
    void Close(const Chain& chain) {
        std::vector<std::array<int, 2>> points;
        std::unordered_map<long long, std::size_t> seen;  // point -> its place in `points`
        auto key = [](const std::array<int, 2>& p) {
            return static_cast<long long>(p[0]) << 32 | static_cast<unsigned int>(p[1]);
        };
        for (int n = chain.head;;) {
            const std::array<int, 2> point = {nodes_[n].x, nodes_[n].y};
            if (chain.pinched) {
                const auto [at, added] = seen.emplace(key(point), points.size());
                if (!added) {  // a loop from the earlier visit to this one
                    const std::size_t from = at->second;
                    for (std::size_t i = from + 1; i < points.size(); ++i)
                        seen.erase(key(points[i]));
                    AddRing(points.begin() + static_cast<std::ptrdiff_t>(from), points.end(),
                            chain.component);
                    points.resize(from);
                }
            }
            points.push_back(point);
            const int next = nodes_[n].next;
            free_.push_back(n);
            if (n == chain.tail)
                break;
            n = next;
        }
        if (!chain.pinched) {
            points.pop_back();  // the first point again
            AddRing(points.begin(), points.end(), chain.component);
        }
    }
    void AddRing(std::vector<std::array<int, 2>>::const_iterator begin,
                 std::vector<std::array<int, 2>>::const_iterator end, int component) {
        const std::size_t count = static_cast<std::size_t>(end - begin);
        auto ring = std::make_unique<OGRLinearRing>();
        long long area = 0;
        for (std::size_t i = 0; i < count; ++i) {
            const auto& p = begin[(i + count - 1) % count];
            const auto& q = begin[i];
            const auto& r = begin[(i + 1) % count];
            area += static_cast<long long>(q[0]) * r[1] - static_cast<long long>(r[0]) * q[1];
            if ((q[0] - p[0]) * (r[1] - q[1]) == (q[1] - p[1]) * (r[0] - q[0]))
                continue;  // on a straight stretch
            ring->addPoint(geo_[0] + q[0] * geo_[1] + q[1] * geo_[2],
                           geo_[3] + q[0] * geo_[4] + q[1] * geo_[5]);
        }
        ring->closeRings();
        rings_.push_back({std::move(ring), component, area > 0});
    }

    GDALRasterBand& band_;
    const double* geo_;
    std::vector<int> components_;  // union-find of the runs' labels
    std::vector<GInt32> values_;
    std::vector<Node> nodes_;
    std::vector<int> free_;
    std::vector<Chain> chains_;
    std::vector<int> freeChains_;
    std::vector<Ring> rings_;
};

}  // namespace

void WriteSeamlines(const std::string& sourceRaster, const std::vector<RecoveryScene>& scenes,
                    const Grid& grid, const std::string& path) {
    ErrorCapture errors;
    DatasetPtr source(GDALDataset::Open(sourceRaster.c_str(), GDAL_OF_RASTER | GDAL_OF_READONLY,
                                        nullptr, nullptr));
    if (!source)
        FailFile(sourceRaster, "cannot be opened", errors);
    OGRSpatialReference srs = GridSrs(grid);

    double geo[6] = {0, 1, 0, 0, 0, 1};
    source->GetGeoTransform(geo);

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
    // The regions (0, no scene, left out), each as a polygon of its pixels' edges.
    RegionTracer tracer(*source->GetRasterBand(1), geo);
    try {
        tracer.Trace([&](int value, std::unique_ptr<OGRPolygon> region) {
            if (value < 1 || static_cast<std::size_t>(value) > scenes.size())
                FailFile(sourceRaster,
                         "holds value " + std::to_string(value) + ", which no scene has", errors);
            const RecoveryScene& scene = scenes[static_cast<std::size_t>(value) - 1];
            const std::unique_ptr<OGRFeature> out(
                OGRFeature::CreateFeature(layer->GetLayerDefn()));
            out->SetField(kSceneField, scene.name.c_str());
            out->SetField("master_line", static_cast<int>(scene.masterLine));
            out->SetField("ortho", scene.ortho.c_str());
            out->SetField("source", scene.source.c_str());
            out->SetGeometryDirectly(region.release());
            if (layer->CreateFeature(out.get()) != OGRERR_NONE)
                FailFile(path, "a region of " + scene.name + " cannot be written", errors);
        });
    } catch (const RegionTracer::Failure& e) {
        FailFile(sourceRaster, std::string("its regions cannot be traced: ") + e.what(), errors);
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
