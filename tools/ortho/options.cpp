#include "options.h"

#include <kestrel/trueortho.h>

#include <gdal.h>
#include <ogr_srs_api.h>

#include <cerrno>
#include <cmath>
#include <cstdlib>
#include <limits>

namespace ortho {

namespace {

std::string Quoted(const std::string& text) {
    return "\"" + text + "\"";
}

double ParseNumber(const std::string& option, const std::string& text) {
    const char* begin = text.c_str();
    char* end = nullptr;
    errno = 0;
    const double value = std::strtod(begin, &end);
    if (text.empty() || end != begin + text.size() || errno == ERANGE || !std::isfinite(value))
        throw UsageError(option + ": " + Quoted(text) + " is not a number");
    return value;
}

unsigned int ParseCount(const std::string& option, const std::string& text) {
    if (text.empty() || text.find_first_not_of("0123456789") != std::string::npos)
        throw UsageError(option + ": " + Quoted(text) + " is not a whole number");
    errno = 0;
    const unsigned long long value = std::strtoull(text.c_str(), nullptr, 10);
    if (errno == ERANGE || value > std::numeric_limits<unsigned int>::max())
        throw UsageError(option + ": " + Quoted(text) + " is too large");
    return static_cast<unsigned int>(value);
}

std::vector<float> ParseFactors(const std::string& option, const std::string& text) {
    std::vector<float> factors;
    std::string::size_type start = 0;
    for (;;) {
        const auto comma = text.find(',', start);
        const std::string item = text.substr(start, comma - start);
        const double value = ParseNumber(option, item);
        if (std::fabs(value) > std::numeric_limits<float>::max())
            throw UsageError(option + ": " + Quoted(item) + " is too large");
        factors.push_back(static_cast<float>(value));
        if (comma == std::string::npos)
            break;
        start = comma + 1;
    }
    return factors;
}

// "A:B", "A:" (to the end) or "A" (one line).
void ParseLines(const std::string& text, Options& options) {
    const auto colon = text.find(':');
    options.hasLines = true;
    options.firstLine = ParseCount("--lines", text.substr(0, colon));
    if (colon == std::string::npos) {
        if (options.firstLine == std::numeric_limits<unsigned int>::max())
            throw UsageError("--lines: " + Quoted(text) + " is too large");
        options.endLine = options.firstLine + 1;
        return;
    }
    const std::string end = text.substr(colon + 1);
    options.endLine =
        end.empty() ? std::numeric_limits<unsigned int>::max() : ParseCount("--lines", end);
    if (options.endLine <= options.firstLine)
        throw UsageError("--lines: " + Quoted(text) +
                         " is an empty slice (A:B runs lines A to B-1, counted from 0)");
}

// value when it is one of the words, else a UsageError listing them.
std::string OneOf(const std::string& option, const std::string& value,
                  const std::vector<std::string>& words) {
    std::string listed;
    for (const std::string& word : words) {
        if (value == word)
            return value;
        listed += (listed.empty() ? "" : ", ") + word;
    }
    throw UsageError(option + ": " + Quoted(value) + " is not one of " + listed);
}

}  // namespace

Options ParseOptions(const std::vector<std::string>& args) {
    Options options;
    std::vector<std::string> positional;
    for (std::size_t i = 0; i < args.size(); ++i) {
        std::string name = args[i];
        std::string value;
        bool hasValue = false;
        if (name.size() > 2 && name.compare(0, 2, "--") == 0) {
            const auto equals = name.find('=');
            if (equals != std::string::npos) {
                value = name.substr(equals + 1);
                name.erase(equals);
                hasValue = true;
            }
        } else if (name.empty() || name[0] != '-' || name == "-") {
            positional.push_back(name);
            continue;
        }
        const auto flag = [&]() {
            if (hasValue)
                throw UsageError(name + " takes no value");
        };
        const auto take = [&]() -> std::string {
            if (hasValue)
                return value;
            if (i + 1 >= args.size())
                throw UsageError(name + " needs a value");
            return args[++i];
        };
        if (name == "-h" || name == "--help") {
            flag();
            options.help = true;
        } else if (name == "--version") {
            flag();
            options.version = true;
        } else if (name == "--out" || name == "-o") {
            options.outDir = take();
        } else if (name == "--dem") {
            options.dem = take();
        } else if (name == "--tin") {
            options.tin = take();
        } else if (name == "--elevref") {
            options.elevref = take();
        } else if (name == "--elfactor") {
            options.elfactor = ParseFactors(name, take());
        } else if (name == "--elunits") {
            options.elunits = take();
        } else if (name == "--srs") {
            options.srs = take();
        } else if (name == "--pixel-size") {
            const std::string text = take();
            options.pixelSize = ParseNumber(name, text);
            if (!(options.pixelSize > 0.0))
                throw UsageError(name + ": " + Quoted(text) + " is not a positive size");
        } else if (name == "--tr") {
            if (hasValue)
                throw UsageError(name + " takes two values: --tr XRES YRES");
            for (double* size : {&options.xRes, &options.yRes}) {
                const std::string text = take();
                *size = ParseNumber(name, text);
                if (*size <= 0.0)
                    throw UsageError(name + ": " + Quoted(text) + " is not a positive size");
            }
        } else if (name == "--te") {
            if (hasValue)
                throw UsageError(name + " takes four values: --te XMIN YMIN XMAX YMAX");
            for (double& bound : options.extent)
                bound = ParseNumber(name, take());
            options.hasExtent = true;
            const auto& e = options.extent;
            if (!(e[0] < e[2]) || !(e[1] < e[3]))
                throw UsageError(name + ": XMIN must be less than XMAX and YMIN less than YMAX");
        } else if (name == "--te-srs") {
            options.extentSrs = take();
        } else if (name == "--cutline") {
            options.cutline = take();
        } else if (name == "--blend-width") {
            const std::string text = take();
            const unsigned int width = ParseCount(name, text);
            if (width > kestrel::processes::RecoveryJob::kMaxBlendWidth)
                throw UsageError(name + ": " + Quoted(text) + " is more than " +
                                 std::to_string(kestrel::processes::RecoveryJob::kMaxBlendWidth) +
                                 " pixels");
            options.blendWidth = width;
        } else if (name == "--blend") {
            options.blend = OneOf(name, take(), {"feather", "multiband"});
        } else if (name == "--balance") {
            options.balance = OneOf(name, take(), {"gain", "gain-offset", "none"});
        } else if (name == "--seams") {
            options.seams = OneOf(name, take(), {"lines", "pixel"});
        } else if (name == "--seamlines") {
            options.seamlines = take();
        } else if (name == "--dtm") {
            options.dtm = take();
        } else if (name == "--resample") {
            options.resample = take();
        } else if (name == "--proc") {
            options.proc = take();
        } else if (name == "--of") {
            options.format = take();
        } else if (name == "--co") {
            options.creationOptions.push_back(take());
        } else if (name == "--cameras") {
            options.cameras = take();
        } else if (name == "--cameras-srs") {
            options.camerasSrs = take();
        } else if (name == "--jobs" || name == "-j") {
            const std::string text = take();
            options.jobs = ParseCount(name, text);
            if (options.jobs == 0)
                throw UsageError(name + ": at least one job is needed");
        } else if (name == "--lines") {
            ParseLines(take(), options);
        } else if (name == "--keep-going" || name == "-k") {
            flag();
            options.keepGoing = true;
        } else if (name == "--quiet" || name == "-q") {
            flag();
            options.quiet = true;
        } else if (name == "--overwrite") {
            flag();
            options.overwrite = true;
        } else {
            throw UsageError("unknown option " + Quoted(name) + " (see --help)");
        }
    }
    if (options.help || options.version)
        return options;
    if (positional.empty())
        throw UsageError("the master parameter file is missing (or give the images)");
    options.inputs = positional;
    if (options.outDir.empty())
        throw UsageError("--out DIR is missing");
    if (options.dem.empty() == options.tin.empty())
        throw UsageError("give the surface model with exactly one of --dem and --tin");
    if (options.format.empty())
        throw UsageError("--of: the file type is empty");
    if (options.resample.empty())
        throw UsageError("--resample: the method is empty");
    if (!options.extentSrs.empty() && !options.hasExtent)
        throw UsageError("--te-srs is the CRS of --te, which is missing");
    if (options.xRes > 0.0 && options.pixelSize > 0.0)
        throw UsageError("--tr and --pixel-size both set the pixel size; give one of them");
    if (!options.camerasSrs.empty() && options.cameras.empty())
        throw UsageError("--cameras-srs is the CRS of a --cameras file, which is missing");
    return options;
}

std::string VersionText() {
    int major = 0, minor = 0, patch = 0;
    OSRGetPROJVersion(&major, &minor, &patch);
    return std::string("silvan-ortho ") + SILVAN_VERSION + " (GDAL " +
           GDALVersionInfo("RELEASE_NAME") + ", PROJ " + std::to_string(major) + "." +
           std::to_string(minor) + "." + std::to_string(patch) + ")\n";
}

std::string UsageText() {
    return R"(usage: silvan-ortho MASTER --out DIR (--dem DSM | --tin TIN) [options]
       silvan-ortho IMAGE [IMAGE...] --out DIR (--dem DSM | --tin TIN) [options]

Runs the true-ortho workflow of a master parameter file: derives the preparation and image-set
files, makes the ortho, visibility index, scene description and footprint of every scene on its
window of one common grid (the grid's cells under its footprint), then fills the hidden ground of each image from the others (occlusion recovery)
into a true-ortho mosaic, with PNG quicklooks. A run that was stopped does only what is missing
when started again.

Images may be given instead of the master file (told apart by their content, not their names):
they run with the master file's default columns (all channels, segment 0, every image in the
mosaic), and the master file used is written to DIR/master.txt.

Surface model (the terrain with its buildings):
  --dem PATH          raster DSM: a file GDAL reads, a directory of tiles or a VRT mosaic
  --tin PATH          TIN surface: a vector file of triangles or 3-D points
  --elevref KEYWORD   vertical datum of the surface heights: MSL (default), ELLIPS, MATHMODEL
  --elfactor O[,S]    height correction: offset O, then scale S (> 0)
  --elunits UNIT      unit of the surface heights: METER (default), FOOT, US_FOOT

Cameras (instead of each source's own model, docs/cameras.md):
  --cameras FILE      the frame camera of every image from an OpenSfM reconstruction.json or
                      an exterior-orientation table (image X Y Z omega phi kappa)
  --cameras-srs CRS   the coordinate system of the table's centres, with its vertical datum
                      (EPSG:25832+7837, EPSG:4979, ...)

Output:
  --out DIR           output directory (created when missing)
  --srs CRS           output coordinate system, projected or geographic (EPSG:32632, WKT,
                      PROJ string; default: the UTM zone of the scene)
  --pixel-size SIZE   output pixel size in CRS units (default: the source's resolution)
  --tr XRES YRES      output pixel width and height in CRS units, as gdalwarp's -tr (instead
                      of --pixel-size)
  --te XMIN YMIN XMAX YMAX
                      area of interest in the output CRS, as gdalwarp's -te: the common grid
                      is exactly this rectangle (with --tr, the cells gdalwarp -te -tr makes),
                      and scenes whose footprint does not reach it are skipped; without --tr
                      or --pixel-size, the extent is kept and the pixel size adjusted to whole
                      cells of about the source's resolution, as gdalwarp. Without --te the
                      grid's corners are whole multiples of the pixel size, the grid grown
                      outward to hold every scene (as gdalwarp's -tap)
  --te-srs CRS        the coordinate system of --te, when it is not the output CRS (the
                      rectangle's densified edges are transformed, their bounding box taken)
  --cutline FILE      a polygon layer (the file's first, any OGR format): mosaic pixels whose
                      centre lies outside it are left empty, as gdalwarp's -cutline, and
                      scenes whose footprint does not reach it are skipped
  --resample METHOD   near, bilinear (default), cubic, cubicspline, lanczos, average, mode
  --proc TEXT         generator: AUTO[:threads], CPU[:threads], GPU[:devices] (PROC syntax)
  --of TYPE           file type of the rasters: tif (default), cog, img, gpkg, png, jpg, webp,
                      jp2, ... or a GDAL raster driver that writes files; the mosaic of tif or
                      cog is a Cloud Optimized GeoTIFF. With a lossy type the visibility index
                      and mosaic_source stay lossless GeoTIFFs, so that their values hold
  --co NAME=VALUE     a GDAL creation option of the mosaic and the orthos (repeatable), as
                      gdalwarp's -co: COMPRESS=JPEG, COMPRESS=WEBP, QUALITY=85, BLOCKSIZE=256,
                      ...; each takes the options its driver knows (with tif the orthos are
                      GeoTIFFs, the mosaic a COG); one that neither knows is refused. The
                      mosaic's DEFLATE is at LEVEL=5 (LEVEL=6, GDAL's default: some 8 %
                      smaller, twice the compression time)

Mosaic (only the mosaic is made again when these change):
  --dtm PATH          ground heights without buildings (a raster, in the surface's datum and
                      unit), for seamlines that keep off raised objects (default: estimated
                      from the surface model)
  --seamlines FILE    make the mosaic from these regions: the polygon layer "seamlines" (any
                      OGR format), as DIR/seamlines.gpkg holds it and edited in a GIS, say; each
                      feature's field "scene" names the scene its pixels come from, later
                      features win where polygons overlap, and pixels no polygon covers take
                      the scene that sees them best (as --seams pixel)
  --seams METHOD      how the mosaic's regions are chosen: lines (default), seamlines solved
                      over the whole mosaic that keep off raised objects and colour edges;
                      pixel, each pixel from the scene that sees it best (clear view, lower
                      radiometric level, line of sight nearer the vertical), with no seams to
                      solve: under half of the mosaic step's time, seams wherever the choice
                      changes
  --blend-width N     blend the two scenes across each seam over N mosaic pixels (default 16;
                      0: hard seams; at most 4096)
  --blend METHOD      feather (default) or multiband (Laplacian pyramid)
  --balance METHOD    colour balance per scene and channel: gain, gain-offset (default) or none

Running:
  --jobs N, -j N      scenes run at the same time (default 1)
  --lines A:B         only lines A to B-1 of the preparation file (from 0; "A:" to the end,
                      "A" one line), for a scheduler that runs slices; the recovery step then
                      waits for a run without --lines
  --keep-going, -k    go on after a scene fails; the failures are listed in the summary
  --quiet, -q         print errors only
  --overwrite         make every output again, even those whose inputs and options have not
                      changed since they were made
  --help, -h          this text
  --version           the version of silvan-ortho, GDAL and PROJ

Outputs in DIR: master.txt (when images were given), prep.txt and imgset.txt (derived
parameter files); per scene NAME_ortho.tif, NAME_vis.tif, NAME.xml (scene description, with
TOSceneDesc_Document.dtd), NAME_footprint.gpkg and NAME_manifest.json (what made them);
footprints.gpkg (one layer per scene), mosaic.tif, mosaic_source.tif, seamlines.gpkg (the
mosaic's regions, for --seamlines), mosaic_manifest.json;
PNG quicklooks with world files (NAME_vis.png, mosaic.png, mosaic_source.png and its legend
mosaic_source_legend.json); summary.json (summary-A-B.json for a slice).

Exit status: 0 when everything asked for was done, 1 when something failed, 2 for a bad
command line, 130 when interrupted (Ctrl-C).
)";
}

}  // namespace ortho
