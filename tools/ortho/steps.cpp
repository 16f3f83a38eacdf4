#include "steps.h"

#include "files.h"
#include "seamlines.h"

#include <kestrel/trueortho.h>
#include <silvan/parserfactory.h>
#include <silvan/toppfbase.h>
#include <silvan/utils.h>

#include <kestrel/crs.h>
#include <kestrel/exception.h>
#include <kestrel/formats.h>
#include <kestrel/orthoutils.h>
#include <kestrel/processparams.h>
#include <kestrel/rasterio.h>

#include <cpl_error.h>
#include <gdal_alg.h>
#include <gdal_priv.h>
#include <ogrsf_frmts.h>

#include <algorithm>
#include <cctype>
#include <cmath>
#include <cstdio>
#include <filesystem>
#include <limits>
#include <sstream>

namespace ortho {

void DatasetClose::operator()(GDALDataset* dataset) const {
    GDALClose(dataset);
}

[[noreturn]] void FailFile(const std::string& path, const std::string& what,
                           const ErrorCapture& errors) {
    KESTREL_THROW(kestrel::FileAccessException, path, kestrel::FileAccessException::AccessFailed,
                  what + ": " + errors.Reason());
}

DatasetPtr CreateVector(const std::string& path, const ErrorCapture& errors) {
    GDALDriver* driver = GetGDALDriverManager()->GetDriverByName("GPKG");
    RemoveFile(path);
    DatasetPtr dataset(
        driver == nullptr ? nullptr : driver->Create(path.c_str(), 0, 0, 0, GDT_Unknown, nullptr));
    if (!dataset)
        FailFile(path, "cannot be created as a GeoPackage", errors);
    return dataset;
}

OGRSpatialReference GridSrs(const Grid& grid) {
    OGRSpatialReference srs;
    srs.SetAxisMappingStrategy(OAMS_TRADITIONAL_GIS_ORDER);
    if (srs.importFromWkt(grid.crs.c_str()) != OGRERR_NONE)
        KESTREL_THROW(kestrel::DataException, "the grid's CRS cannot be read: " + grid.crs);
    return srs;
}

DatasetPtr CreateGridRaster(const Grid& grid, const std::string& path, const ErrorCapture& errors,
                            GDALDataType type) {
    GDALDriver* driver = GetGDALDriverManager()->GetDriverByName("GTiff");
    const char* createOptions[] = {"TILED=YES", "COMPRESS=DEFLATE", "SPARSE_OK=YES", nullptr};
    RemoveFile(path);
    DatasetPtr raster(driver == nullptr
                          ? nullptr
                          : driver->Create(path.c_str(), static_cast<int>(grid.pixels),
                                           static_cast<int>(grid.lines), 1, type,
                                           const_cast<char**>(createOptions)));
    if (!raster)
        FailFile(path, "cannot be created", errors);
    std::array<double, 6> geoTransform = grid.geoTransform;
    raster->SetGeoTransform(geoTransform.data());
    const OGRSpatialReference srs = GridSrs(grid);
    raster->SetSpatialRef(&srs);
    return raster;
}

double Grid::PixelSize() const {
    return std::hypot(geoTransform[1], geoTransform[4]);
}

bool Grid::SameAs(const Grid& other) const {
    if (pixels != other.pixels || lines != other.lines)
        return false;
    const double tolerance = 1e-3 * std::max(PixelSize(), 1e-12);
    for (std::size_t i = 0; i < geoTransform.size(); ++i) {
        if (std::fabs(geoTransform[i] - other.geoTransform[i]) > tolerance)
            return false;
    }
    if (crs == other.crs)
        return true;
    try {
        return kestrel::ogc::cs::ICRS(crs).IsSame(kestrel::ogc::cs::ICRS(other.crs));
    } catch (const kestrel::Exception&) {
        return false;
    }
}

std::string Grid::Describe() const {
    std::string name = crs;
    try {
        name = kestrel::ogc::cs::ICRS(crs).GetName();
    } catch (const kestrel::Exception&) {
    }
    char size[64];
    if (std::fabs(geoTransform[1] + geoTransform[5]) > 1e-9 * std::fabs(geoTransform[1]))
        std::snprintf(size, sizeof size, "%.6g x %.6g", geoTransform[1], -geoTransform[5]);
    else
        std::snprintf(size, sizeof size, "%.6g", PixelSize());
    char text[256];
    std::snprintf(text, sizeof text, "%u x %u pixels of %s, top left (%.3f, %.3f), ", pixels, lines,
                  size, geoTransform[0], geoTransform[3]);
    return text + name;
}

namespace {

// The cells of the area as gdalwarp -te -tr makes them (sizes rounded to whole pixels); a
// message naming --te when they are none or too many.
std::string AreaGridSize(const Area& a, double width, double height, unsigned int& pixels,
                         unsigned int& lines) {
    const double across = WholeCells(a[2] - a[0], width);
    const double down = WholeCells(a[3] - a[1], height);
    if (!(across >= 1 && down >= 1 && across <= 1u << 30 && down <= 1u << 30))
        return kestrel::FormatString("--te: the area of interest makes a grid of %.0f x %.0f "
                                     "pixels of %g x %g",
                                     across, down, width, height);
    pixels = static_cast<unsigned int>(across);
    lines = static_cast<unsigned int>(down);
    return std::string();
}

}  // namespace

Grid CommonGrid(const std::vector<Grid>& grids, const Area* area) {
    if (grids.empty())
        KESTREL_THROW(kestrel::DataException, "no grid to join");
    const Grid& first = grids.front();
    const auto& g = first.geoTransform;
    if (g[2] != 0.0 || g[4] != 0.0 || g[1] <= 0.0 || g[5] >= 0.0)
        KESTREL_THROW(kestrel::DataException,
                      "a common grid needs north-up grids; the first is " + first.Describe());
    double left = g[0], right = g[0] + first.pixels * g[1];
    double top = g[3], bottom = g[3] + first.lines * g[5];
    const kestrel::ogc::cs::ICRS crs(first.crs);
    for (const Grid& grid : grids) {
        const auto& t = grid.geoTransform;
        if (std::fabs(t[1] - g[1]) > 1e-9 * g[1] || std::fabs(t[5] - g[5]) > 1e-9 * g[1] ||
            t[2] != 0.0 || t[4] != 0.0)
            KESTREL_THROW(kestrel::DataException,
                          "grids of different pixel sizes cannot be "
                          "joined: " +
                              first.Describe() + " and " + grid.Describe());
        if (grid.crs != first.crs && !crs.IsSame(kestrel::ogc::cs::ICRS(grid.crs)))
            KESTREL_THROW(kestrel::DataException, "grids in different CRSs cannot be joined: " +
                                                      first.Describe() + " and " + grid.Describe());
        left = std::min(left, t[0]);
        right = std::max(right, t[0] + grid.pixels * t[1]);
        top = std::max(top, t[3]);
        bottom = std::min(bottom, t[3] + grid.lines * t[5]);
    }
    const double step = g[1], height = -g[5];
    Grid common;
    common.crs = first.crs;
    if (area != nullptr) {
        // gdalwarp -te -tr: the top left corner at XMIN YMAX, sizes rounded to whole pixels.
        const Area& a = *area;
        const std::string refused = AreaGridSize(a, step, height, common.pixels, common.lines);
        if (!refused.empty())
            KESTREL_THROW(kestrel::DataException, refused);
        common.geoTransform = {a[0], step, 0.0, a[3], 0.0, g[5]};
        return common;
    }
    // Corners on whole multiples of the pixel size, grown outward; whole blocks of 16.
    const double x0 = std::floor(left / step + 1e-6) * step;
    const double y0 = std::ceil(top / height - 1e-6) * height;
    const auto blocks = [](double cells) {
        const auto n = static_cast<unsigned int>(std::ceil(cells - 1e-6));
        return (n + 15u) / 16u * 16u;
    };
    common.pixels = blocks((right - x0) / step);
    common.lines = blocks((y0 - bottom) / height);
    common.geoTransform = {x0, step, 0.0, y0, 0.0, g[5]};
    return common;
}

namespace {
DatasetPtr OpenCutline(const std::string& path, const ErrorCapture& errors);

std::unique_ptr<OGRPolygon> Rectangle(double minX, double minY, double maxX, double maxY) {
    OGRLinearRing corners;
    corners.addPoint(minX, minY);
    corners.addPoint(maxX, minY);
    corners.addPoint(maxX, maxY);
    corners.addPoint(minX, maxY);
    corners.closeRings();
    auto rectangle = std::make_unique<OGRPolygon>();
    rectangle->addRing(&corners);
    return rectangle;
}

// The footprint as a valid polygon (one that crosses itself is made valid, as GEOS needs); null
// without a geometry engine.
std::unique_ptr<OGRGeometry> FootprintShape(const kestrel::tin::Polygon<double>& footprint) {
    OGRLinearRing ring;
    for (unsigned int i = 0; i < footprint.numPoints; ++i)
        ring.addPoint(footprint.points[i].x, footprint.points[i].y);
    ring.closeRings();
    OGRPolygon scene;
    scene.addRing(&ring);
    return std::unique_ptr<OGRGeometry>(scene.IsValid() ? scene.clone() : scene.MakeValid());
}
}  // namespace

Area AreaInCrs(const Options& options, const std::string& crs) {
    if (options.extentSrs.empty())
        return options.extent;
    ErrorCapture errors;
    OGRSpatialReference from;
    from.SetAxisMappingStrategy(OAMS_TRADITIONAL_GIS_ORDER);
    if (from.SetFromUserInput(options.extentSrs.c_str()) != OGRERR_NONE)
        throw UsageError("--te-srs: \"" + options.extentSrs + "\" cannot be read as a CRS");
    Grid target;
    target.crs = crs;
    const OGRSpatialReference to = GridSrs(target);
    const std::unique_ptr<OGRCoordinateTransformation> transform(
        OGRCreateCoordinateTransformation(&from, &to));
    const auto& e = options.extent;
    Area area{};
    if (!transform || !transform->TransformBounds(e[0], e[1], e[2], e[3], &area[0], &area[1],
                                                  &area[2], &area[3], 21))
        KESTREL_THROW(kestrel::DataException,
                      "--te in --te-srs " + options.extentSrs +
                          " cannot be transformed into the output CRS: " + errors.Reason());
    return area;
}

AreaOfInterest::AreaOfInterest(const Options& options, const std::string& crs,
                               const Area* area) {
    ErrorCapture errors;
    if (area != nullptr)
        shape_ = Rectangle((*area)[0], (*area)[1], (*area)[2], (*area)[3]);
    if (options.cutline.empty())
        return;
    DatasetPtr vector = OpenCutline(options.cutline, errors);
    OGRLayer* layer = vector->GetLayer(0);
    Grid target;
    target.crs = crs;
    const OGRSpatialReference to = GridSrs(target);
    OGRSpatialReference from(*layer->GetSpatialRef());
    from.SetAxisMappingStrategy(OAMS_TRADITIONAL_GIS_ORDER);
    const std::unique_ptr<OGRCoordinateTransformation> transform(
        OGRCreateCoordinateTransformation(&from, &to));
    if (!transform)
        throw UsageError("--cutline: " + options.cutline +
                         ": its CRS cannot be transformed into the output CRS: " +
                         errors.Reason());
    std::unique_ptr<OGRGeometry> cut;
    layer->ResetReading();
    for (auto& feature : *layer) {
        const OGRGeometry* geometry = feature->GetGeometryRef();
        if (geometry == nullptr)
            continue;
        std::unique_ptr<OGRGeometry> copy(geometry->clone());
        if (copy->transform(transform.get()) != OGRERR_NONE)
            throw UsageError("--cutline: " + options.cutline +
                             ": a polygon cannot be transformed into the output CRS");
        if (!copy->IsValid())
            copy.reset(copy->MakeValid());
        if (!copy)
            return;  // no geometry engine: only the rectangle selects scenes
        if (cut) {
            cut.reset(cut->Union(copy.get()));
            if (!cut)
                return;
        } else {
            cut = std::move(copy);
        }
    }
    if (!cut)
        throw UsageError("--cutline: " + options.cutline + ": the first layer holds no polygons");
    if (shape_) {
        std::unique_ptr<OGRGeometry> both(shape_->Intersection(cut.get()));
        if (both)
            shape_ = std::move(both);
    } else {
        shape_ = std::move(cut);
    }
}

AreaOfInterest::~AreaOfInterest() = default;

bool AreaOfInterest::Reaches(const kestrel::tin::Polygon<double>& footprint) const {
    if (!shape_)
        return true;
    ErrorCapture errors;
    const std::unique_ptr<OGRGeometry> valid = FootprintShape(footprint);
    if (!valid)
        return true;
    const std::unique_ptr<OGRGeometry> shared(valid->Intersection(shape_.get()));
    if (!shared)  // no geometry engine: the scene is kept
        return true;
    return OGR_G_Area(OGRGeometry::ToHandle(shared.get())) > 0.0;
}

bool SceneWindow(const Grid& common, const kestrel::tin::Polygon<double>& footprint,
                 Grid& window) {
    ErrorCapture errors;
    const auto& g = common.geoTransform;
    const std::unique_ptr<OGRPolygon> rectangle =
        Rectangle(g[0], g[3] + common.lines * g[5], g[0] + common.pixels * g[1], g[3]);
    // The footprint's part inside the grid; without a geometry engine, the whole footprint.
    const std::unique_ptr<OGRGeometry> valid = FootprintShape(footprint);
    const std::unique_ptr<OGRGeometry> inside(valid ? valid->Intersection(rectangle.get())
                                                    : nullptr);
    OGREnvelope box;
    if (inside) {
        if (inside->IsEmpty() || OGR_G_Area(OGRGeometry::ToHandle(inside.get())) <= 0.0)
            return false;
        inside->getEnvelope(&box);
    } else {
        for (unsigned int i = 0; i < footprint.numPoints; ++i)
            box.Merge(footprint.points[i].x, footprint.points[i].y);
    }
    // Whole cells, two more on each side, inside the grid.
    const long long margin = 2;
    const auto clip = [](double cell, unsigned int size) {
        return static_cast<long long>(std::clamp(cell, 0.0, static_cast<double>(size)));
    };
    const long long x0 = clip(std::floor((box.MinX - g[0]) / g[1] + 1e-6) - margin, common.pixels);
    const long long x1 = clip(std::ceil((box.MaxX - g[0]) / g[1] - 1e-6) + margin, common.pixels);
    const long long y0 = clip(std::floor((box.MaxY - g[3]) / g[5] + 1e-6) - margin, common.lines);
    const long long y1 = clip(std::ceil((box.MinY - g[3]) / g[5] - 1e-6) + margin, common.lines);
    if (x1 <= x0 || y1 <= y0)
        return false;
    window = WindowAt(common, x0, y0, static_cast<unsigned int>(x1 - x0),
                      static_cast<unsigned int>(y1 - y0));
    return true;
}

Grid WindowAt(const Grid& grid, long long column, long long row, unsigned int pixels,
              unsigned int lines) {
    Grid window = grid;
    window.uncoveredShare = 0.0;
    window.pixels = pixels;
    window.lines = lines;
    const auto& g = grid.geoTransform;
    window.geoTransform[0] = g[0] + static_cast<double>(column) * g[1];
    window.geoTransform[3] = g[3] + static_cast<double>(row) * g[5];
    return window;
}

double WholeCells(double extent, double size) {
    return std::floor((extent + size / 2) / size);
}

std::array<long long, 2> CellOffset(const Grid& grid, const Grid& window) {
    const auto& g = grid.geoTransform;
    const auto& w = window.geoTransform;
    return {std::llround((w[0] - g[0]) / g[1]), std::llround((w[3] - g[3]) / g[5])};
}

bool ReadGrid(const std::string& path, Grid& grid) {
    ErrorCapture errors;
    // The side files (world file, .aux.xml) looked for one by one: listing an output directory
    // of hundreds of scene files costs more, once per raster checked.
    CPLConfigOptionSetter byName("GDAL_DISABLE_READDIR_ON_OPEN", "TRUE", true);
    DatasetPtr dataset(
        GDALDataset::Open(path.c_str(), GDAL_OF_RASTER | GDAL_OF_READONLY, nullptr, nullptr));
    if (!dataset)
        return false;
    Grid read;
    if (dataset->GetGeoTransform(read.geoTransform.data()) != CE_None)
        return false;
    const OGRSpatialReference* srs = dataset->GetSpatialRef();
    if (srs == nullptr)
        return false;
    char* wkt = nullptr;
    const char* wktOptions[] = {"FORMAT=WKT2_2019", "MULTILINE=NO", nullptr};
    if (srs->exportToWkt(&wkt, wktOptions) != OGRERR_NONE) {
        CPLFree(wkt);
        return false;
    }
    read.crs = wkt;
    CPLFree(wkt);
    read.pixels = static_cast<unsigned int>(dataset->GetRasterXSize());
    read.lines = static_cast<unsigned int>(dataset->GetRasterYSize());
    grid = read;
    return true;
}

std::unique_ptr<kestrel::mathmodel::IMathModel> OpenModel(const Options& options,
                                                          const std::string& source, int mmseg) {
    if (!options.cameras.empty())
        return kestrel::mathmodel::OpenCameraModel(source, options.cameras, options.camerasSrs);
    return std::unique_ptr<kestrel::mathmodel::IMathModel>(GetMathModel(source, mmseg));
}

std::unique_ptr<kestrel::mathmodel::IMathModel> OpenModel(const Options& options,
                                                          const SceneInput& scene) {
    return OpenModel(options, scene.source, scene.mmseg);
}

namespace {

// Runs a check of one option; what it throws becomes a UsageError naming the option.
template <typename Check>
void CheckOption(const std::string& option, Check check) {
    try {
        check();
    } catch (const UsageError&) {
        throw;
    } catch (const std::exception& e) {
        throw UsageError(option + ": " + Explain(e));
    }
}

void CheckSurfaceFile(const std::string& option, const std::string& path) {
    std::error_code ec;
    if (!path.empty() && !std::filesystem::exists(path, ec))
        throw UsageError(option + ": " + path + ": not found");
}

// A file (not a directory of tiles) that GDAL cannot open as a raster.
void CheckRasterFile(const std::string& path) {
    std::error_code ec;
    if (path.empty() || std::filesystem::is_directory(path, ec))
        return;
    ErrorCapture errors;
    DatasetPtr raster(
        GDALDataset::Open(path.c_str(), GDAL_OF_RASTER | GDAL_OF_READONLY, nullptr, nullptr));
    if (!raster)
        throw UsageError("--dtm: " + path + ": cannot be opened as a raster: " + errors.Reason());
}

void CheckOutputCrs(const std::string& text) {
    if (text.empty())
        return;
    const kestrel::ogc::cs::ICRS crs(text);
    if (!crs.IsProjected() && !crs.IsGeographic())
        throw UsageError("--srs: \"" + text + "\" (" + crs.GetName() +
                         ") is neither a projected nor a geographic coordinate system");
}

// The methods --help lists, in GDAL's spelling; compared without regard to case, as GDAL does.
std::string CheckResampling(const std::string& method) {
    static const char* const kMethods[] = {"near",    "bilinear", "cubic", "cubicspline",
                                           "lanczos", "average",  "mode"};
    const std::string lower = Lower(method);
    std::string known;
    for (const char* name : kMethods) {
        if (lower == name) {
            std::string accepted = lower;
            std::unique_ptr<kestrel::utils::IRasterResampler> resampler(GetResampler(accepted));
            return lower;
        }
        known += (known.empty() ? "" : ", ") + std::string(name);
    }
    throw UsageError("--resample: unknown method \"" + method + "\"; use one of " + known);
}

// A file type whose GDAL driver is in this build and writes files, directly or by copy.
void CheckFileType(const std::string& type) {
    const std::string format = kestrel::core::FType2FormatName(type);
    ErrorCapture errors;
    GDALDriver* driver = GetGDALDriverManager()->GetDriverByName(format.c_str());
    if (driver == nullptr)
        throw UsageError("--of: " + type + ": GDAL's " + format +
                         " driver is not in this build of GDAL");
    if (format == "MEM" || format == "VRT")
        throw UsageError("--of: " + type + ": GDAL's " + format +
                         " driver keeps no pixels in a file of its own");
    if (format == "XYZ")
        throw UsageError("--of: " + type +
                         ": GDAL's XYZ text holds no coordinate system; the outputs would lose "
                         "their georeferencing");
    // The outputs are named NAME_ortho.TYPE: an ENVI dataset is named after its data file.
    if (Lower(type) == "hdr")
        throw UsageError("--of: hdr names the ENVI header, not the data file; give envi");
    if (driver->GetMetadataItem(GDAL_DCAP_CREATE) == nullptr &&
        driver->GetMetadataItem(GDAL_DCAP_CREATECOPY) == nullptr)
        throw UsageError("--of: " + type + ": GDAL's " + format + " driver cannot write files");
}

// A process that only makes its generator, to see what the PROC text gives.
class GeneratorProbe : public kestrel::processes::silvan::TOPPFBase {
  public:
    explicit GeneratorProbe(const std::string& procText) { SetProc(procText); }
    void Execute() override {}
};

// Makes the generator of the PROC text as a scene will; the line to tell the user when a
// graphics processor was asked for and the central processor will run instead.
std::string CheckGenerator(const std::string& procText) {
    ProcessStrategy strategy = PROCESS_STRATEGY_AUTO;
    int first = 0, second = 0, third = 0;
    std::vector<int> list;
    GetProcessParameters(procText, strategy, first, second, third, list);
    GeneratorProbe probe(procText);
    const std::unique_ptr<kestrel::processes::TorthoGenerator> generator(
        probe.CreateTorthoGenerator());
    if (strategy != PROCESS_STRATEGY_GPU ||
        generator->GetProcessor() != kestrel::processes::ProcessorKind::Central)
        return "";
    const unsigned int threads = generator->GetThreadCount();
    return "--proc " + procText +
           ": no graphics processor can be used; the central-processor generator runs instead (" +
           (threads == 0 ? std::string("threads chosen by the generator")
                         : std::to_string(threads) + " threads") +
           ")";
}

}  // namespace

std::string MosaicFormat(const Options& options) {
    const std::string format = kestrel::core::FType2FormatName(options.format);
    return format == "GTiff" ? "COG" : format;
}

namespace {

// GDAL drivers that write lossy files by default: JPEG changes values even at its highest
// quality.
bool LossyFormat(const std::string& format) {
    return format == "JPEG" || format == "WEBP" || format == "JP2OpenJPEG" ||
           format == "JPEGXL" || format == "JP2KAK" || format == "JP2ECW";
}

bool TakesOption(const std::string& format, const std::string& option) {
    try {
        kestrel::core::CheckCreationOptions(format, {option});
        return true;
    } catch (const kestrel::Exception&) {
        return false;
    }
}

// Each --co must be taken by the mosaic's driver or by the per-scene orthos' (GTiff's options
// for the orthos of tif, COG's for its mosaic); one that neither takes is refused with the
// mosaic driver's reason.
void CheckCreationOptions(const Options& options) {
    const std::string mosaic = MosaicFormat(options);
    const std::string ortho = kestrel::core::FType2FormatName(options.format);
    for (const std::string& option : options.creationOptions) {
        if (ortho == mosaic || !TakesOption(ortho, option))
            kestrel::core::CheckCreationOptions(mosaic, {option});
    }
}

// BasicWriter's option text: each option quoted, after the defaults (which they override).
std::string OptionText(const std::string& defaults, const std::vector<std::string>& options) {
    std::string text = defaults;
    for (const std::string& option : options)
        text += " \"" + option + "\"";
    return text;
}

std::vector<std::string> TakenOptions(const Options& options, const std::string& format) {
    std::vector<std::string> taken;
    for (const std::string& option : options.creationOptions) {
        if (TakesOption(format, option))
            taken.push_back(option);
    }
    return taken;
}

// The --co options that GDAL's format takes, after `defaults`: each raster takes those its driver
// knows (the orthos GTiff's, the mosaic COG's).
std::string TakenOptions(const Options& options, const std::string& format,
                         const std::string& defaults) {
    return OptionText(defaults, TakenOptions(options, format));
}

// The options of a per-scene raster of GDAL's format: the generator's own, then, for the ortho,
// the --co options its driver takes.
std::string SceneRasterOptions(const Options& options, const std::string& format, bool classes) {
    const std::string defaults = kestrel::processes::SceneRasterOptions(format, classes);
    return classes ? defaults : TakenOptions(options, format, defaults);
}

}  // namespace

std::vector<std::string> TakenCreationOptions(const Options& options, bool mosaic) {
    return TakenOptions(options, mosaic ? MosaicFormat(options)
                                        : kestrel::core::FType2FormatName(options.format));
}

std::string ClassRasterType(const std::string& type) {
    std::string format;
    try {
        format = kestrel::core::FType2FormatName(type);
    } catch (const std::exception&) {
        return type;  // refused by the option checks
    }
    return LossyFormat(format) ? "tif" : type;
}

std::vector<std::string> CheckOptions(Options& options) {
    CheckSurfaceFile("--dem", options.dem);
    CheckSurfaceFile("--tin", options.tin);
    CheckSurfaceFile("--cameras", options.cameras);
    CheckSurfaceFile("--dtm", options.dtm);
    CheckOption("--dtm", [&] { CheckRasterFile(options.dtm); });
    CheckOption("--cameras-srs", [&] {
        if (!options.camerasSrs.empty())
            kestrel::ogc::cs::ICRS{options.camerasSrs};
    });
    CheckOption("--elevref", [&] { GetVertDatum(options.elevref); });
    double offset = 0.0, scale = 1.0;
    CheckOption("--elfactor", [&] { GetElFactor(options.elfactor, offset, scale); });
    if (!options.elunits.empty())
        CheckOption("--elunits", [&] { GetElUnits(options.elunits, scale); });
    CheckOption("--srs", [&] { CheckOutputCrs(options.srs); });
    CheckOption("--te-srs", [&] {
        if (!options.extentSrs.empty())
            kestrel::ogc::cs::ICRS{options.extentSrs};
    });
    // In the output CRS with the pixel size given, the area's grid is known now.
    const double width = options.xRes > 0.0 ? options.xRes : options.pixelSize;
    const double height = options.yRes > 0.0 ? options.yRes : options.pixelSize;
    unsigned int pixels = 0, lines = 0;
    if (options.hasExtent && options.extentSrs.empty() && width > 0.0 && height > 0.0) {
        const std::string refused = AreaGridSize(options.extent, width, height, pixels, lines);
        if (!refused.empty())
            throw UsageError(refused);
    }
    if (!options.cutline.empty())
        CheckCutline(options.cutline);
    if (!options.seamlines.empty())
        CheckSeamlines(options.seamlines);
    CheckOption("--resample", [&] { options.resample = CheckResampling(options.resample); });
    CheckOption("--of", [&] { CheckFileType(options.format); });
    CheckOption("--co", [&] { CheckCreationOptions(options); });
    std::vector<std::string> notes;
    CheckOption("--proc", [&] {
        const std::string note = CheckGenerator(options.proc);
        if (!note.empty())
            notes.push_back(note);
    });
    CheckSurface(options);
    return notes;
}

namespace {

// The datum and unit to open the heights of path (given by option) with, from its file and the
// options.
kestrel::dem::SurfaceHeights ResolveHeights(const Options& options, const std::string& path,
                                            const std::string& option) {
    kestrel::ogc::cs::DatumType declared = kestrel::ogc::cs::DatumMSL;
    if (!options.elevref.empty())
        declared = GetVertDatum(options.elevref);
    try {
        return kestrel::dem::ResolveSurfaceHeights(path,
                                                   options.elevref.empty() ? nullptr : &declared,
                                                   options.elunits, "--elevref", "--elunits");
    } catch (const kestrel::FileException&) {
        throw;
    } catch (const kestrel::Exception& e) {
        // The platform's messages begin with the path: name the option too.
        std::string message = e.what();
        if (message.compare(0, path.size(), path) != 0)
            message = path + ": " + message;
        KESTREL_THROW(kestrel::DataException, option + " " + message);
    }
}

bool DeclaresMathModel(const Options& options) {
    return !options.elevref.empty() &&
           GetVertDatum(options.elevref) == kestrel::ogc::cs::DatumMathModel;
}

// Why heights whose file says its datum cannot be taken in the math model's datum, as
// --elevref MATHMODEL declares; empty when they can.
std::string ModelDatumConflict(const Options& options, const kestrel::dem::SurfaceHeights& heights,
                               const std::string& path, const std::string& option,
                               kestrel::ogc::cs::DatumType modelDatum) {
    if (!heights.file.known || !DeclaresMathModel(options) || modelDatum == heights.file.datum)
        return std::string();
    return option + " " + path + ": its CRS says the heights are \"" + heights.file.name +
           "\", which is not the math model's vertical datum, as --elevref MATHMODEL declares: "
           "leave --elevref out to follow the file";
}

void CheckHeights(const Options& options, const std::string& path, const std::string& option) {
    if (path.empty())
        return;
    try {
        ResolveHeights(options, path, option);
    } catch (const kestrel::FileException&) {
        // A file that cannot be read fails where the heights are opened, naming it.
    } catch (const kestrel::Exception& e) {
        throw UsageError(e.what());
    }
}

// Heights of a raster (rasterOnly) or of a raster or TIN, corrected as the surface's.
std::unique_ptr<kestrel::dem::IElevationSource> OpenHeights(
    const Options& options, const std::string& path, const std::string& option, bool raster,
    const kestrel::mathmodel::IMathModel* model) {
    const kestrel::dem::SurfaceHeights heights = ResolveHeights(options, path, option);
    double offset = 0.0, scale = 1.0;
    GetElFactor(options.elfactor, offset, scale);
    // The unit once: the declared one where the file says none (the source applies the file's).
    scale *= heights.unitScale;
    kestrel::ogc::cs::DatumType datum = heights.datum;
    const kestrel::ogc::cs::DatumType modelDatum = GetModelDatum(model);
    const std::string conflict = ModelDatumConflict(options, heights, path, option, modelDatum);
    if (!conflict.empty())
        KESTREL_THROW(kestrel::DataException, conflict);
    if (raster) {
        // The first band; no-data as the raster declares it.
        return std::unique_ptr<kestrel::dem::IElevationSource>(
            GetDem(path, 0, offset, scale, std::numeric_limits<float>::quiet_NaN(), datum,
                   modelDatum));
    }
    // The first layer holding triangles or 3-D points.
    std::unique_ptr<kestrel::dem::IElevationSource> tin(
        GetDbm(path, 0, offset, scale, datum, modelDatum));
    if (!tin)
        KESTREL_THROW(kestrel::FileNotFoundException, path,
                      "cannot be opened as a TIN: no layer of triangles or 3-D points");
    return tin;
}

}  // namespace

void CheckSurface(const Options& options) {
    if (options.dem.empty() && options.tin.empty())
        return;
    CheckHeights(options, options.dem.empty() ? options.tin : options.dem,
                 options.dem.empty() ? "--tin" : "--dem");
    CheckHeights(options, options.dtm, "--dtm");
}

void CheckModels(const Options& options) {
    const bool mathModel = DeclaresMathModel(options);
    if (options.cameras.empty() && !mathModel)
        return;
    const std::string surface = options.dem.empty() ? options.tin : options.dem;
    const std::string option = options.dem.empty() ? "--tin" : "--dem";
    kestrel::dem::SurfaceHeights heights;
    if (mathModel && !surface.empty()) {
        try {
            heights = ResolveHeights(options, surface, option);
        } catch (const std::exception&) {
            // Refused by CheckSurface, or left to where the heights are opened.
        }
    }
    if (options.cameras.empty() && !heights.file.known)
        return;
    // The sources with their model segments: the images given, or the master file's lines
    // (source in the first column, segment in the third).
    struct Source {
        std::string where, path;
        int mmseg = 0;
    };
    std::vector<Source> sources;
    for (const std::string& image : options.images)
        sources.push_back({image, image, 0});
    if (options.images.empty()) {
        const std::filesystem::path masterDir =
            std::filesystem::absolute(options.master).parent_path();
        for (const auto& line : DataLines(options.master)) {
            const std::vector<std::string> columns = LineColumns(line.second);
            Source source{options.master + ", line " + std::to_string(line.first),
                          ResolveSource(columns[0], masterDir), 0};
            try {
                if (columns.size() > 2 && !columns[2].empty())
                    source.mmseg = std::stoi(columns[2]);
            } catch (const std::exception&) {
                continue;  // refused, naming the line, where the master file is read
            }
            sources.push_back(std::move(source));
        }
    }
    // A camera file that orients none of the images is refused; one image missing from it
    // fails that scene only. A model whose datum is not the surface file's fails every scene.
    // The cameras of one file share its CRS: the first one oriented stands for all of them.
    std::string cameraError;
    bool oriented = false;
    for (const Source& source : sources) {
        if (oriented && !options.cameras.empty())
            break;
        std::error_code ec;
        if (!std::filesystem::exists(source.path, ec))
            continue;  // the scene fails, naming its source
        std::unique_ptr<kestrel::mathmodel::IMathModel> model;
        try {
            model = OpenModel(options, source.path, source.mmseg);
        } catch (const std::exception& e) {
            if (cameraError.empty())
                cameraError = source.where + ": " + Explain(e);
            continue;
        }
        oriented = true;
        const std::string conflict =
            ModelDatumConflict(options, heights, surface, option, GetModelDatum(model.get()));
        if (!conflict.empty())
            throw UsageError("--elevref: " + source.where + ": " + conflict);
    }
    if (!options.cameras.empty() && !oriented && !cameraError.empty())
        throw UsageError("--cameras: " + options.cameras + " orients none of the images: " +
                         cameraError);
}

std::unique_ptr<kestrel::dem::IElevationSource> OpenSurface(
    const Options& options, const kestrel::mathmodel::IMathModel* model) {
    return options.dem.empty() ? OpenHeights(options, options.tin, "--tin", false, model)
                               : OpenHeights(options, options.dem, "--dem", true, model);
}

std::unique_ptr<kestrel::dem::IElevationSource> OpenGround(
    const Options& options, const kestrel::mathmodel::IMathModel* model) {
    if (options.dtm.empty())
        return nullptr;
    return OpenHeights(options, options.dtm, "--dtm", true, model);
}

std::string SurfaceHoles(const Options& options, const Grid& grid) {
    if (options.dem.empty())
        return "";
    const std::unique_ptr<kestrel::dem::IElevationSource> surface = OpenSurface(options, nullptr);
    const auto* dem = dynamic_cast<const kestrel::dem::IRasterDEM*>(surface.get());
    const kestrel::ogc::cs::ICRS crs(grid.crs);
    surface->SetInputCRS(&crs);
    const auto& g = grid.geoTransform;
    double minX = INFINITY, minY = INFINITY, maxX = -INFINITY, maxY = -INFINITY;
    for (double pixel : {0.0, static_cast<double>(grid.pixels)}) {
        for (double line : {0.0, static_cast<double>(grid.lines)}) {
            const double x = g[0] + pixel * g[1] + line * g[2];
            const double y = g[3] + pixel * g[4] + line * g[5];
            minX = std::min(minX, x), maxX = std::max(maxX, x);
            minY = std::min(minY, y), maxY = std::max(maxY, y);
        }
    }
    std::size_t posts = 0, holes = 0;
    if (dem == nullptr || !dem->CountPosts(minX, minY, maxX, maxY, posts, holes))
        return "";
    char text[160];
    std::snprintf(text, sizeof text,
                  ": %zu of %zu posts under the output grid (%.2f %%) have no height", holes, posts,
                  posts > 0 ? 100.0 * holes / posts : 0.0);
    return "--dem " + options.dem + text;
}

Grid SceneLayout(const Options& options, const SceneInput& scene, const std::string& crs,
                 double pixelWidth, double pixelHeight, Footprint* footprint,
                 bool withUncoveredShare) {
    std::unique_ptr<kestrel::datasources::IDataset> dataset(GetRasterDataset(scene.source));
    std::vector<unsigned int> sourceChannels, orthoChannels;
    GetSrcOrthoChans(dataset.get(), scene.channels, sourceChannels, orthoChannels);
    std::unique_ptr<kestrel::datasources::IRasterReader> reader(
        GetRasterReader(dataset.get(), sourceChannels));
    const std::unique_ptr<kestrel::mathmodel::IMathModel> model = OpenModel(options, scene);
    const std::unique_ptr<kestrel::dem::IElevationSource> surface =
        OpenSurface(options, model.get());

    // The layout traces the image border onto a raster DEM; over a TIN it takes the flat
    // height of the TIN's centre.
    auto* dem = dynamic_cast<kestrel::dem::IRasterDEM*>(surface.get());
    float flatHeight = 0.0f;
    if (dem == nullptr) {
        double minX, minY, maxX, maxY, height = 0.0;
        surface->GetExtent(minX, minY, maxX, maxY);
        surface->SetInputCRS(nullptr);
        if (!surface->GetHeight((minX + maxX) / 2, (minY + maxY) / 2, height))
            KESTREL_THROW(kestrel::DataException, options.tin +
                                                      ": no height at the centre of the "
                                                      "surface, for the layout");
        flatHeight = static_cast<float>(height);
    }
    const std::vector<int> channels(sourceChannels.begin(), sourceChannels.end());
    kestrel::ogc::cs::ICRS* crsOut = nullptr;
    kestrel::ogc::cs::GeocodingInfo* geocodingOut = nullptr;
    kestrel::tin::Polygon<double>* footprintOut = nullptr;
    unsigned int pixels = 0, lines = 0;
    try {
        // Border rays every 16 pixels; grid corners on whole multiples of the pixel size, so
        // that the scenes' grids share one lattice.
        GetOrthoParams(0, "PIXEL", crs, pixelWidth, pixelHeight, dataset.get(), model.get(), channels,
                       dem, flatHeight, crsOut, geocodingOut, pixels, lines, footprintOut);
    } catch (...) {
        delete crsOut;
        delete geocodingOut;
        throw;
    }
    const std::unique_ptr<kestrel::ogc::cs::ICRS> outCrs(crsOut);
    const std::unique_ptr<kestrel::ogc::cs::GeocodingInfo> outGeocoding(geocodingOut);
    Footprint outFootprint(footprintOut);
    if (!outCrs || !outGeocoding)
        KESTREL_THROW(kestrel::DataException, scene.source + ": the layout gave no grid");
    Grid grid;
    grid.crs = outCrs->GetWKT();
    grid.geoTransform = outGeocoding->GetGeoTransform();
    grid.pixels = pixels;
    grid.lines = lines;
    if (footprint != nullptr)
        *footprint = std::move(outFootprint);
    if (withUncoveredShare && dem != nullptr)
        grid.uncoveredShare =
            kestrel::orthoutils::ComputeLayout(*model, dem, kestrel::orthoutils::LayoutRequest())
                .uncoveredShare;
    return grid;
}

namespace {

// A process whose generator reports to a step's progress. A progress that says stop (the run
// is interrupted) sets the process's cancel flag, and the generator stops within a tile.
class StepProcess : public kestrel::processes::silvan::TOPPFBase {
  protected:
    StepProcess(const std::string& procText, const StepProgress& progress) : progress_(progress) {
        SetProc(procText);
    }
    void Attach(kestrel::processes::ITrueOrtho& generator) {
        generator.SetCancelFlag(GetCancelFlag());
        generator.SetProgress(Report, this);
    }

  private:
    static bool Report(double fraction, const char*, void* data) {
        auto& process = *static_cast<StepProcess*>(data);
        if (!process.progress_ || process.progress_(fraction))
            return true;
        process.SetCancelFlag(true);
        return false;
    }
    const StepProgress& progress_;
};

// The true-ortho process of one scene: its generator comes from the PROC text.
class OrthoProcess : public StepProcess {
  public:
    OrthoProcess(const std::string& procText, const kestrel::processes::TorthoJob& job,
                 const StepProgress& progress)
        : StepProcess(procText, progress), job_(job) {}
    void Execute() override {
        std::unique_ptr<kestrel::processes::TorthoGenerator> generator(CreateTorthoGenerator());
        Attach(*generator);
        result_ = generator->Generate(job_);
    }
    const kestrel::processes::TorthoResult& Result() const { return result_; }

  private:
    const kestrel::processes::TorthoJob& job_;
    kestrel::processes::TorthoResult result_;
};

// The gap-filling process of an image set.
class RecoveryProcess : public StepProcess {
  public:
    RecoveryProcess(const std::string& procText, const kestrel::processes::RecoveryJob& job,
                    const StepProgress& progress)
        : StepProcess(procText, progress), job_(job) {}
    void Execute() override {
        std::unique_ptr<kestrel::processes::OcclusionRecovery> generator(CreateOcclusionRecovery());
        Attach(*generator);
        result_ = generator->Recover(job_);
    }
    const kestrel::processes::TorthoRecoveryResult& Result() const { return result_; }

  private:
    const kestrel::processes::RecoveryJob& job_;
    kestrel::processes::TorthoRecoveryResult result_;
};

// Source pixels per output pixel, along the grid's pixels and lines, at the grid's centre on
// the surface: the footprint of the area methods (average, mode) and the widening of the other
// kernels where the ortho is coarser than the image, as in gdalwarp. Left as it is where the
// centre has no height or no image position.
void SetSourceStep(kestrel::utils::IRasterResampler& resampler,
                   const kestrel::mathmodel::IMathModel& model,
                   kestrel::dem::IElevationSource& surface, const Grid& grid,
                   const kestrel::ogc::cs::ICRS& crs) {
    const kestrel::ogc::cs::GeocodingInfo geocoding(grid.geoTransform);
    const double p = grid.pixels / 2.0, l = grid.lines / 2.0;
    double x[3], y[3], z[3], col[3], row[3];
    bool ok[3];
    geocoding.PixelToGround(p, l, x[0], y[0]);
    geocoding.PixelToGround(p + 1, l, x[1], y[1]);
    geocoding.PixelToGround(p, l + 1, x[2], y[2]);
    surface.SetInputCRS(&crs);
    if (!surface.GetHeight(x[0], y[0], z[0]) || !std::isfinite(z[0]))
        return;
    z[1] = z[2] = z[0];
    if (model.GetCRS() != nullptr && !model.GetCRS()->IsSame(crs))
        kestrel::ogc::cs::CoordinateTransformation(crs, *model.GetCRS()).Transform(3, x, y);
    model.GroundToImage(3, x, y, z, col, row, ok);
    const double stepX = std::hypot(col[1] - col[0], row[1] - row[0]);
    const double stepY = std::hypot(col[2] - col[0], row[2] - row[0]);
    if (ok[0] && ok[1] && ok[2] && stepX > 1e-3 && stepY > 1e-3 && stepX <= 1000 &&
        stepY <= 1000)
        resampler.SetSourceStep(stepX, stepY);
}

}  // namespace

namespace {

// Removes what a writer of path left behind in a run that was killed: its temporaries are
// named "STEM.tmp-TAG...", beside the path. Runs on one directory are one at a time, and the
// slices of a run write other paths.
void RemoveWriterLeftovers(const std::string& path) {
    const std::filesystem::path target(path);
    const std::string prefix = target.stem().string() + ".tmp-";
    std::vector<std::string> leftovers;
    std::error_code ec;
    std::filesystem::directory_iterator entries(
        target.parent_path().empty() ? std::filesystem::path(".") : target.parent_path(), ec);
    for (; !ec && entries != std::filesystem::directory_iterator(); entries.increment(ec)) {
        if (entries->path().filename().string().compare(0, prefix.size(), prefix) == 0)
            leftovers.push_back(entries->path().string());
    }
    for (const std::string& leftover : leftovers)
        RemoveFile(leftover);
}

}  // namespace

OrthoResult MakeOrtho(const Options& options, const SceneInput& scene, const Grid& grid,
                      const std::string& ortho, const std::string& visibility,
                      const StepProgress& progress) {
    const std::unique_ptr<kestrel::mathmodel::IMathModel> model = OpenModel(options, scene);
    const std::unique_ptr<kestrel::dem::IElevationSource> surface =
        OpenSurface(options, model.get());
    std::string method = options.resample;
    const std::unique_ptr<kestrel::utils::IRasterResampler> resampler(GetResampler(method));
    const kestrel::ogc::cs::ICRS crs(grid.crs);

    kestrel::processes::TorthoJob job;
    // The generator's own kernels for the methods it has; the platform's resampler, with the
    // source step of this grid, for the others.
    const std::string name = resampler->GetMethod();
    if (name != "near" && name != "bilinear" && name != "cubic") {
        SetSourceStep(*resampler, *model, *surface, grid, crs);
        job.resampler = resampler.get();
    }
    job.sourcePath = scene.source;
    job.channels = scene.channels;
    job.model = model.get();
    job.surface = surface.get();
    job.resampling = resampler->GetMethod();
    job.crs = &crs;
    job.geocoding = kestrel::ogc::cs::GeocodingInfo(grid.geoTransform);
    job.pixels = grid.pixels;
    job.lines = grid.lines;
    // Both through the platform's writer (every file type, by a temporary GeoTIFF and GDAL's
    // copy where the driver only copies), published only when complete: the ortho in --of's
    // type with the --co its driver takes; the visibility index in a lossless type with options
    // of its own. Deleted unclosed after a failed or cancelled run, they leave nothing.
    std::vector<unsigned int> sourceChannels, orthoChannels;
    {
        std::unique_ptr<kestrel::datasources::IDataset> dataset(GetRasterDataset(scene.source));
        GetSrcOrthoChans(dataset.get(), scene.channels, sourceChannels, orthoChannels);
    }
    std::vector<unsigned int> bands(sourceChannels.size());
    for (std::size_t b = 0; b < bands.size(); ++b)
        bands[b] = static_cast<unsigned int>(b + 1);
    const std::string orthoFormat = kestrel::core::FType2FormatName(options.format);
    const std::string classFormat =
        kestrel::core::FType2FormatName(ClassRasterType(options.format));
    RemoveWriterLeftovers(ortho);
    RemoveWriterLeftovers(visibility);
    kestrel::datasources::BasicWriter orthoWriter(
        ortho, bands, orthoFormat, SceneRasterOptions(options, orthoFormat, false));
    kestrel::datasources::BasicWriter visibilityWriter(
        visibility, {1}, classFormat, SceneRasterOptions(options, classFormat, true));
    job.orthoWriter = &orthoWriter;
    job.visibilityWriter = &visibilityWriter;

    OrthoProcess process(options.proc, job, progress);
    process.Execute();
    if (!process.Result().completed)
        KESTREL_THROW(kestrel::DataException, scene.source + ": the ortho was cancelled");
    OrthoResult result;
    result.orthoNoData = job.orthoNoData;
    double noData = 0.0;
    if (!options.dem.empty()) {
        std::unique_ptr<kestrel::datasources::IDataset> dem(GetRasterDataset(options.dem));
        const auto* raster = dynamic_cast<const kestrel::datasources::IRasterDataset*>(dem.get());
        if (raster != nullptr && raster->GetNoDataValue(1, noData))
            result.elevationNoData = noData;
    }
    return result;
}

void WriteFootprint(const std::string& path, const kestrel::tin::Polygon<double>& footprint) {
    {
        ErrorCapture errors;
        CreateVector(path, errors);
    }
    WriteSceneFootprint(path, &footprint);
}

namespace {

DatasetPtr OpenCutline(const std::string& path, const ErrorCapture& errors) {
    DatasetPtr dataset(
        GDALDataset::Open(path.c_str(), GDAL_OF_VECTOR | GDAL_OF_READONLY, nullptr, nullptr));
    if (!dataset)
        throw UsageError("--cutline: " + path + ": cannot be opened as a vector file: " +
                         errors.Reason());
    OGRLayer* layer = dataset->GetLayerCount() > 0 ? dataset->GetLayer(0) : nullptr;
    const OGRwkbGeometryType type =
        layer == nullptr ? wkbNone : wkbFlatten(layer->GetGeomType());
    if (type != wkbPolygon && type != wkbMultiPolygon && type != wkbUnknown)
        throw UsageError("--cutline: " + path + ": the first layer holds no polygons");
    if (layer->GetSpatialRef() == nullptr)
        throw UsageError("--cutline: " + path + ": the layer has no coordinate system");
    return dataset;
}

// The cutline burnt into a Byte raster on the grid: 1 where a pixel's centre lies inside.
void BurnCutline(const std::string& cutline, const Grid& grid, const std::string& path) {
    ErrorCapture errors;
    DatasetPtr vector = OpenCutline(cutline, errors);
    DatasetPtr mask = CreateGridRaster(grid, path, errors);
    int band = 1;
    double burn = 1.0;
    OGRLayerH layer = OGRLayer::ToHandle(vector->GetLayer(0));
    if (GDALRasterizeLayers(GDALDataset::ToHandle(mask.get()), 1, &band, 1, &layer, nullptr,
                            nullptr, &burn, nullptr, nullptr, nullptr) != CE_None)
        FailFile(cutline, "cannot be burnt into the grid", errors);
    mask->FlushCache();
    if (errors.Failed())
        FailFile(path, "cannot be written", errors);
}

}  // namespace

void CheckCutline(const std::string& path) {
    ErrorCapture errors;
    OpenCutline(path, errors);
}

namespace {

// The raster at `from` copied into a new file of GDAL's format at `to` through the platform's
// writer (a temporary GeoTIFF and GDAL's copy where the driver only copies), strip by strip.
void CopyRaster(const std::string& from, const std::string& to, const std::string& format,
                const std::string& options) {
    kestrel::datasources::BasicReader reader(from);
    std::vector<unsigned int> bands(reader.GetChannelCount());
    for (std::size_t b = 0; b < bands.size(); ++b)
        bands[b] = static_cast<unsigned int>(b + 1);
    RemoveWriterLeftovers(to);
    kestrel::datasources::BasicWriter writer(to, bands, format, options);
    const unsigned int width = reader.GetWidth(), height = reader.GetHeight();
    writer.SetSize(width, height);
    writer.SetDataType(reader.GetDataType());
    writer.SetChannelCount(reader.GetChannelCount());
    writer.SetCRS(reader.GetCRS());
    if (reader.GetGeocoding() != nullptr)
        writer.SetGeocoding(*reader.GetGeocoding());
    double noData = 0.0;
    if (reader.GetNoDataValue(0, noData))
        writer.SetNoDataValue(noData);
    writer.Create();
    const unsigned int strip = 256;
    for (unsigned int y = 0; y < height; y += strip) {
        const std::unique_ptr<kestrel::gobs::Raster> rows(
            reader.ReadWindow(0, y, width, std::min(strip, height - y)));
        writer.WriteWindow(*rows, 0, y);
    }
    writer.Close();
}

}  // namespace

unsigned int BlendWidth(const Options& options) {
    return options.blendWidth ? *options.blendWidth : kestrel::processes::RecoveryJob().blendWidth;
}

BlockCache::BlockCache(GIntBig bytes) {
    if (CPLGetConfigOption("GDAL_CACHEMAX", nullptr) != nullptr)
        return;
    before_ = GDALGetCacheMax64();
    GDALSetCacheMax64(bytes);
}

BlockCache::~BlockCache() {
    if (before_ >= 0)
        GDALSetCacheMax64(before_);
}

MosaicResult RecoverMosaic(const Options& options, const std::vector<RecoveryScene>& scenes,
                           const std::vector<std::string>& others, const Grid& grid,
                           const std::string& mosaic, const std::string& source,
                           const StepProgress& progress) {
    std::vector<std::unique_ptr<kestrel::mathmodel::IMathModel>> models;
    kestrel::processes::RecoveryJob job;
    for (const RecoveryScene& scene : scenes) {
        models.push_back(OpenModel(options, scene.source, scene.mmseg));
        kestrel::processes::RecoveryScene input;
        input.orthoPath = scene.ortho;
        input.visibilityPath = scene.visibility;
        input.radiometricLevel = static_cast<int>(scene.radioDif);
        input.dbmPixelError = scene.dbmPxErr;
        input.model = models.back().get();
        job.scenes.push_back(input);
    }
    job.geocoding = kestrel::ogc::cs::GeocodingInfo(grid.geoTransform);
    job.pixels = grid.pixels;
    job.lines = grid.lines;
    // Heights for the viewing angles and the seam cost, in the models' datum.
    const kestrel::mathmodel::IMathModel* model = models.empty() ? nullptr : models.front().get();
    const std::unique_ptr<kestrel::dem::IElevationSource> surface = OpenSurface(options, model);
    job.surface = surface.get();
    const std::unique_ptr<kestrel::dem::IElevationSource> ground = OpenGround(options, model);
    job.ground = ground.get();
    job.blendWidth = BlendWidth(options);
    job.seamlines = options.seams == "lines";
    using Job = kestrel::processes::RecoveryJob;
    job.blend = options.blend == "multiband" ? Job::Blend::Multiband : Job::Blend::Feather;
    job.balance = options.balance == "none"   ? Job::Balance::None
                  : options.balance == "gain" ? Job::Balance::Gain
                                              : Job::Balance::GainOffset;
    // Files beside the mosaic under temporary names, removed whatever happens: the burnt
    // cutline and regions, and the lossless mosaic that a lossy type is copied from.
    struct Removed {
        std::string path;
        ~Removed() {
            if (!path.empty())
                RemoveFile(path);
        }
    } mask, regions, lossless;
    // A lossy type: recovery writes GeoTIFFs (the source raster stays one), and the mosaic is
    // copied into the type.
    const std::string format = MosaicFormat(options);
    const bool lossy = LossyFormat(format);
    if (lossy)
        lossless.path = mosaic + ".tif";
    RemoveWriterLeftovers(mosaic);
    RemoveWriterLeftovers(source);
    job.mosaicPath = lossy ? lossless.path : mosaic;
    RemoveWriterLeftovers(job.mosaicPath);
    job.sourcePath = source;
    job.format = lossy ? "GTiff" : format;
    if (!lossy)
        job.mosaicOptions = TakenOptions(options, format, "");
    if (!options.cutline.empty()) {
        mask.path = mosaic + ".cutline.tif";
        BurnCutline(options.cutline, grid, mask.path);
        job.maskPath = mask.path;
    }
    MosaicResult result;
    if (!options.seamlines.empty()) {
        regions.path = mosaic + ".regions.tif";
        BurnSeamlines(options.seamlines, scenes, others, grid, regions.path,
                      result.seamlinesSkipped);
        job.regionsPath = regions.path;
    }

    const BlockCache cache(kMosaicCacheBytes);
    RecoveryProcess process(options.proc, job, progress);
    process.Execute();
    if (!process.Result().completed)
        KESTREL_THROW(kestrel::DataException, "occlusion recovery was cancelled");
    if (lossy)
        CopyRaster(lossless.path, mosaic, format, OptionText("", options.creationOptions));
    result.gain = process.Result().gain;
    result.offset = process.Result().offset;
    return result;
}

void MergeFootprints(const std::vector<FootprintLayer>& layers, const Grid& grid,
                     const std::string& path) {
    ErrorCapture errors;
    DatasetPtr merged = CreateVector(path, errors);
    OGRSpatialReference srs = GridSrs(grid);
    for (const FootprintLayer& entry : layers) {
        DatasetPtr scene(GDALDataset::Open(entry.path.c_str(), GDAL_OF_VECTOR | GDAL_OF_READONLY,
                                           nullptr, nullptr));
        if (!scene || scene->GetLayerCount() < 1)
            FailFile(entry.path, "holds no footprint layer", errors);
        OGRLayer* from = scene->GetLayer(0);
        OGRLayer* to = merged->CreateLayer(entry.name.c_str(), &srs, wkbPolygon, nullptr);
        if (to == nullptr)
            FailFile(path, "layer " + entry.name + " cannot be created", errors);
        OGRFieldDefn name("Name", OFTString);
        OGRFieldDefn source("Source", OFTString);
        if (to->CreateField(&name) != OGRERR_NONE || to->CreateField(&source) != OGRERR_NONE)
            FailFile(path, "the fields of layer " + entry.name + " cannot be created", errors);
        from->ResetReading();
        while (OGRFeature* read = from->GetNextFeature()) {
            std::unique_ptr<OGRFeature> in(read);
            std::unique_ptr<OGRFeature> out(OGRFeature::CreateFeature(to->GetLayerDefn()));
            const int field = in->GetFieldIndex("Name");
            out->SetField("Name", field >= 0 ? in->GetFieldAsString(field) : "");
            out->SetField("Source", entry.source.c_str());
            if (in->GetGeometryRef() != nullptr)
                out->SetGeometry(in->GetGeometryRef());
            if (to->CreateFeature(out.get()) != OGRERR_NONE)
                FailFile(path, "the footprint of " + entry.name + " cannot be written", errors);
        }
    }
    merged.reset();
    if (errors.Failed())
        FailFile(path, "cannot be written", errors);
}

namespace {

// Classes and image numbers as distinct colours.
const unsigned char kPalette[][3] = {{40, 40, 40},   {80, 200, 80},  {220, 60, 60},
                                     {60, 120, 230}, {240, 200, 40}, {200, 80, 220},
                                     {60, 210, 210}, {250, 140, 40}, {150, 150, 150}};
constexpr int kColours = sizeof kPalette / sizeof kPalette[0];

}  // namespace

std::string SourceColour(unsigned int value) {
    const unsigned char* rgb = kPalette[value % kColours];
    char text[8];
    std::snprintf(text, sizeof text, "#%02x%02x%02x", rgb[0], rgb[1], rgb[2]);
    return text;
}

void WriteQuicklook(const std::string& raster, const std::string& png, Quicklook kind) {
    ErrorCapture errors;
    DatasetPtr source(
        GDALDataset::Open(raster.c_str(), GDAL_OF_RASTER | GDAL_OF_READONLY, nullptr, nullptr));
    if (!source)
        FailFile(raster, "cannot be opened", errors);
    const int width = source->GetRasterXSize(), height = source->GetRasterYSize();
    // A raster of at most kQuicklookSide / 2 pixels on the long side is drawn whole; a larger
    // one at the size of its largest overview of at most kQuicklookSide (GDAL then reads that
    // overview alone: the raster itself is the full-resolution picture), or without one read
    // decimated to kQuicklookSide.
    constexpr int kQuicklookSide = 2048;
    const double shrink = std::max(1.0, std::max(width, height) / double{kQuicklookSide});
    int outWidth = std::max(1, static_cast<int>(width / shrink));
    int outHeight = std::max(1, static_cast<int>(height / shrink));
    if (std::max(width, height) > kQuicklookSide / 2 && source->GetRasterCount() > 0) {
        GDALRasterBand* first = source->GetRasterBand(1);
        for (int k = 0; k < first->GetOverviewCount(); ++k) {
            GDALRasterBand* overview = first->GetOverview(k);
            if (overview != nullptr &&
                std::max(overview->GetXSize(), overview->GetYSize()) <= kQuicklookSide) {
                outWidth = overview->GetXSize(), outHeight = overview->GetYSize();
                break;
            }
        }
    }
    const int bands = kind == Quicklook::Image ? std::min(3, source->GetRasterCount()) : 1;

    // The picture is drawn in strips of rows (read from the raster at the picture's scale), so
    // that memory holds the picture's bytes and one strip, not every value of the picture.
    constexpr int kStripRows = 64;
    const std::size_t stripCount = static_cast<std::size_t>(outWidth) * kStripRows;
    std::vector<float> strip(stripCount * static_cast<std::size_t>(bands));
    std::vector<GByte> mask(stripCount), empty(stripCount);
    std::vector<int> bandList(static_cast<std::size_t>(bands));
    for (int b = 0; b < bands; ++b)
        bandList[b] = b + 1;
    // Reads rows [row, row + rows) of the picture into `strip` (band after band) and marks in
    // `empty` the pixels a band's mask (its no-data value or the file's mask band) leaves out.
    auto read = [&](int row, int rows) {
        const std::size_t count = static_cast<std::size_t>(outWidth) * rows;
        GDALRasterIOExtraArg window;
        INIT_RASTERIO_EXTRA_ARG(window);
        window.bFloatingPointWindowValidity = TRUE;
        window.dfXOff = 0, window.dfXSize = width;
        window.dfYOff = static_cast<double>(row) * height / outHeight;
        window.dfYSize = static_cast<double>(rows) * height / outHeight;
        const int y0 = static_cast<int>(window.dfYOff);
        const int y1 = std::min(height, static_cast<int>(std::ceil(window.dfYOff + window.dfYSize)));
        if (source->RasterIO(GF_Read, 0, y0, width, y1 - y0, strip.data(), outWidth, rows,
                             GDT_Float32, bands, bandList.data(), 0, 0,
                             static_cast<GSpacing>(count) * sizeof(float), &window) != CE_None)
            FailFile(raster, "cannot be read", errors);
        std::fill(empty.begin(), empty.begin() + static_cast<std::ptrdiff_t>(count), GByte{0});
        bool datasetMaskRead = false;  // a mask of the whole file is every band's: read once
        for (int b = 0; b < bands; ++b) {
            GDALRasterBand* band = source->GetRasterBand(b + 1);
            const int flags = band->GetMaskFlags();
            const bool masked = flags != GMF_ALL_VALID;
            const bool datasetMask = (flags & GMF_PER_DATASET) != 0;
            if (masked && !(datasetMask && datasetMaskRead) &&
                band->GetMaskBand()->RasterIO(GF_Read, 0, y0, width, y1 - y0, mask.data(),
                                              outWidth, rows, GDT_Byte, 0, 0,
                                              &window) != CE_None)
                FailFile(raster, "cannot be read", errors);
            datasetMaskRead = datasetMaskRead || datasetMask;
            const float* values = strip.data() + count * static_cast<std::size_t>(b);
            for (std::size_t i = 0; i < count; ++i) {
                if (std::isnan(values[i]) || (masked && mask[i] == 0))
                    empty[i] = 1;
            }
        }
        return count;
    };

    // Red, green, blue, alpha, strip by strip into the picture; classes as indexes into the
    // palette (index 0 transparent, k + 1 the colour of class k), a quarter of the bytes to
    // filter and compress.
    GDALDriver* memory = GetGDALDriverManager()->GetDriverByName("MEM");
    GDALDriver* pngDriver = GetGDALDriverManager()->GetDriverByName("PNG");
    const int channels = kind == Quicklook::Image ? 4 : 1;
    DatasetPtr picture(memory->Create("", outWidth, outHeight, channels, GDT_Byte, nullptr));
    if (!picture)
        FailFile(png, "cannot be drawn", errors);
    if (channels == 1) {
        GDALColorTable palette;
        const GDALColorEntry none = {0, 0, 0, 0};
        palette.SetColorEntry(0, &none);
        for (int k = 0; k < kColours; ++k) {
            const GDALColorEntry colour = {kPalette[k][0], kPalette[k][1], kPalette[k][2], 255};
            palette.SetColorEntry(k + 1, &colour);
        }
        picture->GetRasterBand(1)->SetColorTable(&palette);
    }
    std::vector<GByte> pixels(stripCount * channels);
    auto put = [&](int row, int rows) {
        if (picture->RasterIO(GF_Write, 0, row, outWidth, rows, pixels.data(), outWidth, rows,
                              GDT_Byte, channels, nullptr, 0, 0,
                              static_cast<GSpacing>(outWidth) * rows, nullptr) != CE_None)
            FailFile(png, "cannot be drawn", errors);
    };
    // An image's strip as red, green, blue (one band: grey) and alpha, each value through
    // `colour`.
    auto drawImage = [&](std::size_t count, auto colour) {
        GByte* alpha = pixels.data() + 3 * count;
        for (std::size_t i = 0; i < count; ++i)
            alpha[i] = empty[i] ? 0 : 255;
        for (int b = 0; b < bands; ++b) {
            const float* values = strip.data() + count * static_cast<std::size_t>(b);
            for (std::size_t i = 0; i < count; ++i) {
                const GByte byte = colour(values[i]);
                for (int c = b; c < (bands == 1 ? 3 : b + 1); ++c)
                    pixels[count * c + i] = byte;
            }
        }
    };

    // One stretch for all bands, so that colours keep their balance: between the 2nd and 98th
    // percentiles of the values with data, taken from every pixel or, on larger pictures, from
    // pixels evenly spread (at most kStretchSamples values: a few MB). Byte values are drawn
    // as they are while the samples are taken, and then stretched in the picture, so that the
    // raster is read once.
    double low = 0, scale = 0;
    bool drawn = false;
    if (kind == Quicklook::Image) {
        drawn = std::all_of(bandList.begin(), bandList.end(), [&](int b) {
            return source->GetRasterBand(b)->GetRasterDataType() == GDT_Byte;
        });
        constexpr std::size_t kStretchSamples = std::size_t{1} << 20;
        const std::size_t area = static_cast<std::size_t>(outWidth) * outHeight;
        const std::size_t stride = std::max<std::size_t>(1, area * bands / kStretchSamples + 1);
        std::vector<float> data;
        data.reserve(std::min(area * bands, kStretchSamples + bands));
        std::size_t first = 0;  // index in the picture of the strip's first pixel
        for (int row = 0; row < outHeight; row += kStripRows) {
            const int rows = std::min(kStripRows, outHeight - row);
            const std::size_t count = read(row, rows);
            for (std::size_t i = (stride - first % stride) % stride; i < count; i += stride) {
                if (empty[i])
                    continue;
                for (int b = 0; b < bands; ++b)
                    data.push_back(strip[count * static_cast<std::size_t>(b) + i]);
            }
            first += count;
            if (drawn) {
                drawImage(count, [](float v) { return static_cast<GByte>(v); });
                put(row, rows);
            }
        }
        auto percentile = [&data](std::size_t share, double none) {
            if (data.empty())
                return none;
            const auto at = data.begin() + static_cast<std::ptrdiff_t>(data.size() * share / 100);
            std::nth_element(data.begin(), at, data.end());
            return static_cast<double>(*at);
        };
        low = percentile(2, 0.0);
        const double high = percentile(98, 1.0);
        scale = high > low ? 254.0 / (high - low) : 0.0;
    }
    auto stretch = [&](float value) {
        const double v = 1.0 + (value - low) * scale;
        return static_cast<GByte>(std::clamp(v, 1.0, 255.0));
    };

    if (drawn) {
        // Every byte value through the stretch, in place in the picture's colour bands; other
        // pictures are drawn now, strip by strip.
        GByte table[256];
        for (int v = 0; v < 256; ++v)
            table[v] = stretch(static_cast<float>(v));
        const int coloured = bands == 1 ? 3 : bands;
        for (int row = 0; row < outHeight; row += kStripRows) {
            const int rows = std::min(kStripRows, outHeight - row);
            const std::size_t count = static_cast<std::size_t>(outWidth) * rows;
            for (GDALRWFlag direction : {GF_Read, GF_Write}) {
                if (picture->RasterIO(direction, 0, row, outWidth, rows, pixels.data(), outWidth,
                                      rows, GDT_Byte, coloured, nullptr, 0, 0,
                                      static_cast<GSpacing>(count), nullptr) != CE_None)
                    FailFile(png, "cannot be drawn", errors);
                if (direction == GF_Read) {
                    for (std::size_t i = 0; i < coloured * count; ++i)
                        pixels[i] = table[pixels[i]];
                }
            }
        }
    }
    for (int row = 0; row < outHeight && !drawn; row += kStripRows) {
        const int rows = std::min(kStripRows, outHeight - row);
        const std::size_t count = read(row, rows);
        if (channels == 4) {
            drawImage(count, stretch);
        } else {
            for (std::size_t i = 0; i < count; ++i) {
                const auto v = static_cast<long long>(std::llround(strip[i]));
                pixels[i] =
                    empty[i] ? 0 : static_cast<GByte>(1 + ((v % kColours) + kColours) % kColours);
            }
        }
        put(row, rows);
    }
    if (channels == 4)
        picture->GetRasterBand(4)->SetColorInterpretation(GCI_AlphaBand);
    // A world file places the picture where the raster lies, at its own pixel size.
    double geo[6] = {};
    const bool placed = source->GetGeoTransform(geo) == CE_None;
    if (placed) {
        const double sx = static_cast<double>(width) / outWidth;
        const double sy = static_cast<double>(height) / outHeight;
        geo[1] *= sx, geo[4] *= sx, geo[2] *= sy, geo[5] *= sy;
        picture->SetGeoTransform(geo);
    }
    RemoveFile(png);
    // The fastest deflate level: a quicklook is looked at, not archived.
    const char* const fast[] = {"ZLEVEL=1", nullptr};
    DatasetPtr written(pngDriver->CreateCopy(png.c_str(), picture.get(), FALSE,
                                             const_cast<char**>(fast), nullptr, nullptr));
    if (!written)
        FailFile(png, "cannot be written", errors);
    written.reset();
    RemoveFile(png + ".aux.xml");
    // NAME.pgw, which no raster format but PNG reads (a .wld would be a JPEG raster's too).
    if (placed && !GDALWriteWorldFile(png.c_str(), "pgw", geo))
        FailFile(png, "cannot have its world file written", errors);
}

std::string Lower(std::string text) {
    for (char& c : text) {
        if (c >= 'A' && c <= 'Z')
            c = static_cast<char>(c - 'A' + 'a');
    }
    return text;
}

}  // namespace ortho
