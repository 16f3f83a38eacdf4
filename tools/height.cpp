// Prints the heights of a DEM, tiled DEM or TIN at the ground points read from standard input.
#include "message.h"

#include <silvan/silvan.h>

#include <cerrno>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <iostream>
#include <memory>
#include <string>
#include <vector>

namespace {

const char* const kUsage =
    "usage: silvan-height DEM [--elevref MSL|ELLIPS] [--elunits UNIT] [--to MSL|ELLIPS]\n"
    "                     [--srs CRS]\n"
    "\n"
    "Reads \"x y\" lines from standard input and prints one height a line, an empty line\n"
    "where there is none.\n"
    "  DEM        a raster GDAL reads, a directory of rasters, a tile index made by\n"
    "             gdaltindex, or a TIN (a vector file of triangles or 3-D points)\n"
    "  --elevref  the datum of the DEM's heights where its CRS says none (default MSL);\n"
    "             one that contradicts the CRS is refused\n"
    "  --elunits  the unit of the DEM's heights where its CRS says none (default METER)\n"
    "  --to       the datum of the printed heights (default: the DEM's)\n"
    "  --srs      the coordinate system of the points (default: the DEM's), e.g. EPSG:4326\n";

struct Options {
    std::string dem;
    std::string elevref;
    std::string elunits;
    std::string to;
    std::string srs;
};

[[noreturn]] void Fail(const std::string& message) {
    std::cerr << "silvan-height: " << message << '\n';
    std::exit(2);
}

Options ParseArguments(int argc, char** argv) {
    Options options;
    for (int i = 1; i < argc; ++i) {
        const std::string a = argv[i];
        if (a == "--help" || a == "-h") {
            std::cout << kUsage;
            std::exit(0);
        }
        std::string* value = a == "--elevref"   ? &options.elevref
                             : a == "--elunits" ? &options.elunits
                             : a == "--to"      ? &options.to
                             : a == "--srs"     ? &options.srs
                                                : nullptr;
        if (value != nullptr) {
            if (i + 1 >= argc)
                Fail("option " + a + " needs a value");
            *value = argv[++i];
        } else if (!a.empty() && a[0] == '-') {
            Fail("unknown option \"" + a + "\" (see --help)");
        } else if (options.dem.empty()) {
            options.dem = a;
        } else {
            Fail("more than one DEM given: \"" + a + "\"");
        }
    }
    if (options.dem.empty())
        Fail("no DEM given (see --help)");
    return options;
}

// "x y" with anything after the two numbers ignored, as gdallocationinfo does.
bool ParsePoint(const std::string& line, double& x, double& y) {
    const char* p = line.c_str();
    char* end = nullptr;
    errno = 0;
    x = std::strtod(p, &end);
    if (end == p || errno != 0)
        return false;
    p = end;
    y = std::strtod(p, &end);
    return end != p && errno == 0 && std::isfinite(x) && std::isfinite(y);
}

// A TIN when the path is no raster DEM: GDAL opens it as a vector only. own gets the datum of
// its heights: its CRS's, or else --elevref's.
std::unique_ptr<kestrel::dem::IElevationSource> Open(const Options& o,
                                                     kestrel::ogc::cs::DatumType& own) {
    kestrel::dem::SurfaceHeights heights;
    try {
        kestrel::ogc::cs::DatumType declared = kestrel::ogc::cs::DatumMSL;
        if (!o.elevref.empty())
            declared = GetVertDatum(o.elevref);
        heights = kestrel::dem::ResolveSurfaceHeights(
            o.dem, o.elevref.empty() ? nullptr : &declared, o.elunits, "--elevref", "--elunits");
    } catch (const kestrel::DataException& e) {
        // An option that is no datum or unit, or that contradicts the DEM's CRS.
        Fail(e.what());
    }
    own = heights.datum;
    const double scale = heights.unitScale;
    if (std::unique_ptr<kestrel::tin::TinReader> tin{GetDbm(o.dem, 0, 0.0, scale, own, own)})
        return tin;
    return std::unique_ptr<kestrel::dem::IElevationSource>(
        GetDem(o.dem, 1, 0.0, scale, NAN, own, own));
}

}  // namespace

int main(int argc, char** argv) {
    const Options options = ParseArguments(argc, argv);
    try {
        kestrel::ogc::cs::DatumType own = kestrel::ogc::cs::DatumMSL;
        auto source = Open(options, own);
        source->SetOutputVerticalDatum(options.to.empty() ? own : GetVertDatum(options.to));
        if (!options.srs.empty()) {
            const kestrel::ogc::cs::ICRS crs(options.srs);
            source->SetInputCRS(&crs);
        }

        // Points are answered in batches: a batch is the fast way through the DEM.
        constexpr std::size_t kBatch = 1 << 16;
        std::vector<double> x, y, h;
        std::string line, out;
        unsigned long long number = 0;
        bool more = true;
        std::string bad;
        while (more && bad.empty()) {
            x.clear(), y.clear();
            while (x.size() < kBatch && (more = static_cast<bool>(std::getline(std::cin, line)))) {
                ++number;
                double px, py;
                if (!ParsePoint(line, px, py)) {
                    bad = "line " + std::to_string(number) + " is not \"x y\": \"" + line + "\"";
                    break;
                }
                x.push_back(px), y.push_back(py);
            }
            h.resize(x.size());
            source->GetHeights(x.size(), x.data(), y.data(), h.data());
            out.clear();
            char text[64];
            for (double v : h) {
                if (!std::isnan(v)) {
                    std::snprintf(text, sizeof text, "%.10g", v);
                    out += text;
                }
                out += '\n';
            }
            std::cout << out;
        }
        if (!bad.empty()) {
            std::cout << std::flush;
            Fail(bad);
        }
    } catch (const kestrel::Exception& e) {
        std::cerr << "silvan-height: " << tools::UserMessage(e) << '\n';
        return 1;
    }
    return 0;
}
