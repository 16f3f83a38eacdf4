// Prints the ortho layout of a source image over a DEM: CRS, geotransform, size and footprint.
#include "message.h"

#include <silvan/silvan.h>

#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <iostream>
#include <memory>
#include <string>

#include <kestrel/dem.h>
#include <kestrel/orthoutils.h>

namespace {

const char kUsage[] =
    "usage: silvan-layout IMAGE --dem DEM [--srs CRS] [--pixel-size SIZE] [--segment N]\n"
    "  IMAGE  a raster with RPC coefficients, ground control points or a geotransform\n"
    "  DEM    a raster DEM (heights converted to the sensor model's vertical datum)\n"
    "  CRS    the output coordinate system (default: the UTM zone of the scene's centre)\n"
    "  SIZE   the output pixel size in CRS units (default: the source's ground resolution)\n"
    "  N      the math-model segment: 1 RPC, 2 GCPs, 3 geotransform, 0 the first found\n";

struct Arguments {
    std::string image, dem, srs;
    double pixelSize = 0.0;
    int segment = 0;
};

bool ParseNumber(const std::string& text, double& value) {
    char* end = nullptr;
    value = std::strtod(text.c_str(), &end);
    return !text.empty() && end != nullptr && *end == '\0' && std::isfinite(value);
}

// Returns 0 when the arguments are usable, else the exit code.
int Parse(int argc, char** argv, Arguments& args) {
    for (int i = 1; i < argc; ++i) {
        const std::string arg = argv[i];
        if (arg == "--help" || arg == "-h") {
            std::cout << kUsage;
            return -1;
        }
        const bool takesValue =
            arg == "--dem" || arg == "--srs" || arg == "--pixel-size" || arg == "--segment";
        if (takesValue && i + 1 >= argc) {
            std::cerr << "silvan-layout: " << arg << " needs a value\n" << kUsage;
            return 2;
        }
        double number = 0.0;
        if (arg == "--dem") {
            args.dem = argv[++i];
        } else if (arg == "--srs") {
            args.srs = argv[++i];
        } else if (arg == "--pixel-size") {
            if (!ParseNumber(argv[++i], number) || number <= 0) {
                std::cerr << "silvan-layout: --pixel-size " << argv[i]
                          << " is not a positive number\n";
                return 2;
            }
            args.pixelSize = number;
        } else if (arg == "--segment") {
            if (!ParseNumber(argv[++i], number) || number != std::floor(number) ||
                std::fabs(number) > 1000) {
                std::cerr << "silvan-layout: --segment " << argv[i] << " is not a whole number\n";
                return 2;
            }
            args.segment = static_cast<int>(number);
        } else if (!arg.empty() && arg[0] == '-') {
            std::cerr << "silvan-layout: unknown option " << arg << "\n" << kUsage;
            return 2;
        } else if (args.image.empty()) {
            args.image = arg;
        } else {
            std::cerr << "silvan-layout: one image only; " << arg << " is one too many\n";
            return 2;
        }
    }
    if (args.image.empty() || args.dem.empty()) {
        std::cerr << kUsage;
        return 2;
    }
    return 0;
}

// The DEM with heights in the model's datum: its own datum is MSL when its CRS has a
// gravity-related vertical part, the ellipsoid otherwise.
kestrel::dem::IRasterDEM* OpenDem(const std::string& path, kestrel::ogc::cs::DatumType target) {
    using kestrel::dem::DEMFactory;
    std::unique_ptr<kestrel::dem::IRasterDEM> dem(DEMFactory::CreateFileRasterDEM(
        path, 1, 0.0, 1.0, NAN, kestrel::ogc::cs::DatumEllipsoid, false, 256));
    const kestrel::ogc::cs::DatumType own =
        kestrel::ogc::utils::GetVerticalDatumType(dem->GetCRS());
    if (own != kestrel::ogc::cs::DatumEllipsoid) {
        dem.reset(DEMFactory::CreateFileRasterDEM(path, 1, 0.0, 1.0, NAN, own, false, 256));
    }
    dem->SetOutputVerticalDatum(target);
    return dem.release();
}

}  // namespace

int main(int argc, char** argv) {
    Arguments args;
    if (const int code = Parse(argc, argv, args))
        return code < 0 ? 0 : code;
    try {
        std::unique_ptr<kestrel::mathmodel::IMathModel> model(
            GetMathModel(args.image, args.segment));
        std::unique_ptr<kestrel::dem::IRasterDEM> dem(
            OpenDem(args.dem, kestrel::ogc::utils::GetVerticalDatumType(model->GetCRS())));
        kestrel::ogc::cs::ICRS* crsOut = nullptr;
        kestrel::ogc::cs::GeocodingInfo* geocodingOut = nullptr;
        kestrel::tin::Polygon<double>* footprintOut = nullptr;
        unsigned int pixels = 0, lines = 0;
        GetOrthoParams(0, "", args.srs, args.pixelSize, args.pixelSize, nullptr, model.get(), {},
                       dem.get(), 0.0f, crsOut, geocodingOut, pixels, lines, footprintOut);
        const std::unique_ptr<kestrel::ogc::cs::ICRS> crs(crsOut);
        const std::unique_ptr<kestrel::ogc::cs::GeocodingInfo> geocoding(geocodingOut);
        const std::unique_ptr<kestrel::tin::Polygon<double>> footprint(footprintOut);

        std::cout << "CRS: " << (crs ? crs->GetName() : std::string("(none)")) << '\n';
        if (crs)
            std::cout << "WKT: " << crs->GetWKT() << '\n';
        const auto& g = geocoding->GetGeoTransform();
        std::printf("Geotransform: %.17g, %.17g, %.17g, %.17g, %.17g, %.17g\n", g[0], g[1], g[2],
                    g[3], g[4], g[5]);
        std::printf("Size: %u pixels x %u lines\n", pixels, lines);
        if (footprint->numPoints == 0) {
            std::printf("Footprint: POLYGON EMPTY\n");
            return 0;
        }
        std::printf("Footprint: POLYGON ((");
        for (unsigned int i = 0; i <= footprint->numPoints; ++i) {
            const auto& p = footprint->points[i % footprint->numPoints];
            std::printf("%s%.17g %.17g", i == 0 ? "" : ",", p.x, p.y);
        }
        std::printf("))\n");
    } catch (const kestrel::Exception& e) {
        std::cerr << "silvan-layout: " << tools::UserMessage(e) << '\n';
        return 1;
    }
    return 0;
}
