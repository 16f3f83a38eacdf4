// Command-line options of silvan-ortho.
#pragma once

#include <array>
#include <optional>
#include <stdexcept>
#include <string>
#include <vector>

namespace ortho {

// A command line that cannot be used; the message names the option and the value.
class UsageError : public std::runtime_error {
  public:
    using std::runtime_error::runtime_error;
};

struct Options {
    // The files named on the command line: one master parameter file, or images. Which of the
    // two they are is told from their content (see inputs.h), which sets master or images.
    std::vector<std::string> inputs;
    std::string master;               // the master parameter file the workflow runs
    std::vector<std::string> images;  // images given instead of a master file
    std::string outDir;               // --out

    // Surface model: a raster DSM (--dem) or a TIN (--tin), exactly one of them.
    std::string dem;
    std::string tin;
    std::string elevref;          // -elevref keyword: MSL (default), ELLIPS, MATHMODEL
    std::vector<float> elfactor;  // offset[,scale]
    std::string elunits;          // unit of the surface heights, e.g. METER, FOOT

    std::string srs;         // output CRS; empty: chosen from the scene
    double pixelSize = 0.0;  // output pixel size in CRS units; 0: the source's resolution
    // --tr XRES YRES: pixel width and height in CRS units, instead of --pixel-size; 0: unset.
    double xRes = 0.0;
    double yRes = 0.0;
    // --te XMIN YMIN XMAX YMAX: the area of interest, in the output CRS or in --te-srs. The
    // common grid is exactly this rectangle, as gdalwarp's -te makes it.
    bool hasExtent = false;
    std::array<double, 4> extent{};
    std::string extentSrs;
    // --cutline FILE: a polygon layer (the first of the file, in any OGR format); mosaic pixels
    // whose centre lies outside it are left empty, as gdalwarp's -cutline.
    std::string cutline;
    // The mosaic's seams, blending and colour balance. These change the mosaic alone.
    std::optional<unsigned int> blendWidth;  // --blend-width: mosaic pixels; unset: the default
    std::string blend = "feather";            // --blend: feather or multiband
    std::string balance = "gain-offset";      // --balance: gain, gain-offset or none
    std::string seams = "lines";              // --seams: lines (solved) or pixel
    // --seamlines FILE: the polygon layer "seamlines" (as DIR/seamlines.gpkg holds it) gives
    // each mosaic pixel its scene; empty: seamlines chosen by the recovery.
    std::string seamlines;
    std::string dtm;  // --dtm: ground heights (a raster) for the seam cost; empty: estimated
    std::string resample = "bilinear";
    std::string proc;            // PROC text of the generator
    std::string format = "tif";  // file type of the ortho and visibility rasters
    std::vector<std::string> creationOptions;  // --co NAME=VALUE, for the mosaic's GDAL driver

    // Every scene's model from one file: an exterior-orientation table (with the CRS of its
    // centres) or an OpenSfM reconstruction; empty: each source's own model.
    std::string cameras;
    std::string camerasSrs;

    unsigned int jobs = 1;  // scenes run at the same time
    // Slice of the preparation file's lines, [firstLine, endLine) counted from 0.
    bool hasLines = false;
    unsigned int firstLine = 0;
    unsigned int endLine = 0;

    bool keepGoing = false;
    bool quiet = false;
    bool overwrite = false;  // make every output again
    bool help = false;
    bool version = false;
};

// Parses the arguments after the program name. Throws UsageError.
Options ParseOptions(const std::vector<std::string>& args);

// The text of --help.
std::string UsageText();

// The text of --version: the project's version, with GDAL's and PROJ's.
std::string VersionText();

}  // namespace ortho
