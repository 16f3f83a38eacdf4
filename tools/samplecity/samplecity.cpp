#include "samplecity.h"

#include <kestrel/exception.h>
#include <kestrel/gdalsupport.h>

#include <gdal_priv.h>

#include <algorithm>
#include <atomic>
#include <cfloat>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <thread>

using kestrel::DataException;
using kestrel::FormatString;
using kestrel::ogc::cs::CoordinateTransformation;
using kestrel::ogc::cs::ICRS;

namespace samplecity {

namespace {

constexpr double kPi = 3.14159265358979323846;
using Vec3 = std::array<double, 3>;

Vec3 Sub(const Vec3& a, const Vec3& b) {
    return {a[0] - b[0], a[1] - b[1], a[2] - b[2]};
}
double Dot(const Vec3& a, const Vec3& b) {
    return a[0] * b[0] + a[1] * b[1] + a[2] * b[2];
}
Vec3 Cross(const Vec3& a, const Vec3& b) {
    return {a[1] * b[2] - a[2] * b[1], a[2] * b[0] - a[0] * b[2], a[0] * b[1] - a[1] * b[0]};
}
Vec3 Normalised(const Vec3& a) {
    const double n = std::sqrt(Dot(a, a));
    return {a[0] / n, a[1] / n, a[2] / n};
}

struct GdalDatasetCloser {
    void operator()(GDALDataset* ds) const { GDALClose(ds); }
};
using DatasetPtr = std::unique_ptr<GDALDataset, GdalDatasetCloser>;

using kestrel::gdalsupport::ErrorCapture;

DatasetPtr OpenRaster(const std::string& path) {
    GDALAllRegister();
    ErrorCapture errors;
    DatasetPtr ds(GDALDataset::Open(path.c_str(), GDAL_OF_RASTER | GDAL_OF_READONLY));
    if (!ds)
        KESTREL_THROW(DataException, FormatString("%s: cannot open the raster: %s", path.c_str(),
                                                  errors.Reason().c_str()));
    return ds;
}

void CheckWrite(CPLErr err, const std::string& path, const ErrorCapture& errors) {
    if (err != CE_None)
        KESTREL_THROW(DataException, FormatString("%s: write failed: %s", path.c_str(),
                                                  errors.Reason().c_str()));
}

// The 20 terms in RPC00B order: 1 L P H LP LH PH L2 P2 H2 PLH L3 LP2 LH2 L2P P3 PH2 L2H P2H H3.
std::array<double, 20> Terms(double L, double P, double H) {
    return {1.0,       L,         P,         H,         L * P,     L * H,     P * H,
            L * L,     P * P,     H * H,     P * L * H, L * L * L, L * P * P, L * H * H,
            L * L * P, P * P * P, P * H * H, L * L * H, P * P * H, H * H * H};
}

double Poly(const std::array<double, 20>& c, const std::array<double, 20>& t) {
    double s = 0;
    for (int k = 0; k < 20; ++k)
        s += c[k] * t[k];
    return s;
}

// Solves the symmetric system a x = b (n unknowns, a row-major) by Gaussian elimination with
// partial pivoting.
std::vector<double> Solve(std::vector<double> a, std::vector<double> b) {
    const size_t n = b.size();
    for (size_t c = 0; c < n; ++c) {
        size_t pivot = c;
        for (size_t r = c + 1; r < n; ++r)
            if (std::fabs(a[r * n + c]) > std::fabs(a[pivot * n + c]))
                pivot = r;
        if (a[pivot * n + c] == 0.0)
            KESTREL_THROW(DataException, "RPC fit: singular normal equations");
        if (pivot != c) {
            for (size_t k = 0; k < n; ++k)
                std::swap(a[c * n + k], a[pivot * n + k]);
            std::swap(b[c], b[pivot]);
        }
        for (size_t r = c + 1; r < n; ++r) {
            const double f = a[r * n + c] / a[c * n + c];
            for (size_t k = c; k < n; ++k)
                a[r * n + k] -= f * a[c * n + k];
            b[r] -= f * b[c];
        }
    }
    std::vector<double> x(n);
    for (size_t i = n; i-- > 0;) {
        double s = b[i];
        for (size_t k = i + 1; k < n; ++k)
            s -= a[i * n + k] * x[k];
        x[i] = s / a[i * n + i];
    }
    return x;
}

// Fits value = Num(t) / Den(t), Num of 20 terms, Den = 1 + d1 L + d2 P + d3 H: a frame camera
// is a ratio of linear functions in a local Cartesian frame, and the cubic numerator absorbs the
// curvature of longitude and latitude. Reweighted so that the fitted error is the image error.
void FitRatio(const std::vector<std::array<double, 20>>& terms, const std::vector<double>& values,
              std::array<double, 20>& num, std::array<double, 20>& den) {
    constexpr size_t n = 23;
    std::vector<double> weights(values.size(), 1.0);
    for (int pass = 0; pass < 3; ++pass) {
        std::vector<double> ata(n * n, 0.0), atb(n, 0.0);
        std::array<double, n> row;
        for (size_t i = 0; i < values.size(); ++i) {
            const auto& t = terms[i];
            for (size_t k = 0; k < 20; ++k)
                row[k] = t[k];
            for (size_t k = 0; k < 3; ++k)
                row[20 + k] = -values[i] * t[1 + k];
            const double w = weights[i];
            for (size_t r = 0; r < n; ++r) {
                atb[r] += w * row[r] * values[i];
                for (size_t c = 0; c < n; ++c)
                    ata[r * n + c] += w * row[r] * row[c];
            }
        }
        for (size_t k = 0; k < n; ++k)
            ata[k * n + k] += 1e-12;
        const std::vector<double> x = Solve(ata, atb);
        num.fill(0.0);
        den.fill(0.0);
        std::copy(x.begin(), x.begin() + 20, num.begin());
        den[0] = 1.0;
        den[1] = x[20], den[2] = x[21], den[3] = x[22];
        for (size_t i = 0; i < values.size(); ++i) {
            const double d = Poly(den, terms[i]);
            weights[i] = 1.0 / (d * d);
        }
    }
}

double Hash01(std::uint64_t v) {
    v ^= v >> 33;
    v *= 0xff51afd7ed558ccdULL;
    v ^= v >> 33;
    v *= 0xc4ceb9fe1a85ec53ULL;
    v ^= v >> 33;
    return static_cast<double>(v >> 11) / static_cast<double>(1ULL << 53);
}

std::uint8_t ToByte(double v) {
    return static_cast<std::uint8_t>(std::lround(std::min(255.0, std::max(0.0, v))));
}

}  // namespace

// ---------------------------------------------------------------------------------------------
// Scenes

CityOptions SmallCity() {
    CityOptions o;
    o.slopeX = 0.01;
    o.slopeY = -0.005;
    // Blocks along two streets, heights from 6 to 30 m; edges on whole DSM cells.
    o.buildings = {
        {30, 30, 60, 70, 12},     {75, 30, 95, 55, 6},      {110, 25, 150, 45, 18},
        {165, 30, 200, 80, 9},    {30, 100, 55, 125, 24},   {75, 95, 125, 140, 15},
        {140, 100, 160, 120, 30}, {175, 105, 210, 150, 8},  {30, 160, 70, 200, 10},
        {90, 165, 110, 185, 21},  {130, 160, 190, 180, 14}, {150, 190, 170, 215, 27},
    };
    const char* names[] = {"north", "east", "south", "west"};
    for (int i = 0; i < 4; ++i)
        o.cameras.push_back({names[i], 90.0 * i + 10.0, 25.0 + 3.0 * i, 400.0, 512, 512, 0.5});
    return o;
}

CityOptions BoxScene(double boxHeight, const std::vector<double>& azimuths, double offNadirDegrees,
                     unsigned int imageSize) {
    CityOptions o;
    o.sizeX = o.sizeY = 160.0;
    o.buildings = {{60, 60, 100, 90, boxHeight}};
    for (double az : azimuths) {
        char name[32];
        std::snprintf(name, sizeof name, "view%03d", static_cast<int>(std::lround(az)) % 360);
        o.cameras.push_back({name, az, offNadirDegrees, 300.0, imageSize, imageSize, 0.5});
    }
    return o;
}

CityOptions BenchCity(unsigned int imageSize) {
    CityOptions o;
    o.sizeX = o.sizeY = std::ceil(imageSize * 0.5 * 1.2);
    o.dsmPixel = 1.0;
    o.slopeX = 0.004;
    for (double y = 10; y + 40 < o.sizeY; y += 40)
        for (double x = 10; x + 40 < o.sizeX; x += 40) {
            const std::uint64_t key = static_cast<std::uint64_t>(x * 7919 + y);
            const double w = 12 + std::floor(16 * Hash01(key)),
                         d = 12 + std::floor(16 * Hash01(key + 1));
            o.buildings.push_back({x, y, x + w, y + d, 6 + std::floor(34 * Hash01(key + 2))});
        }
    o.cameras.push_back({"oblique", 30.0, 20.0, 2500.0, imageSize, imageSize, 0.5});
    return o;
}

CityOptions BlockCity(unsigned int rows, unsigned int cols, unsigned int imageSize, double gsd) {
    if (rows == 0 || cols == 0 || imageSize == 0 || !(gsd > 0))
        KESTREL_THROW(DataException, "Sample block: rows, columns, image size and GSD must be positive");
    CityOptions o;
    o.south = 5033700.0;  // with west, a whole multiple of 1.5 m: of the DSM pixel and the GSD
    o.dsmPixel = 0.5;
    o.slopeX = 0.01, o.slopeY = -0.005;
    const double footprint = imageSize * gsd, base = 0.4 * footprint, spacing = 0.7 * footprint;
    const double margin = 0.1 * footprint;
    auto whole = [](double v) { return 1.5 * std::ceil(v / 1.5); };
    o.sizeX = whole((cols - 1) * base + footprint + 2 * margin);
    o.sizeY = whole((rows - 1) * spacing + footprint + 2 * margin);
    // City blocks 60 m wide between the texture's north-south streets (at whole multiples of 60
    // m from the west edge), three lots across and one every 20 m northwards; some lots empty.
    auto snap = [&](double v) { return o.dsmPixel * std::round(v / o.dsmPixel); };
    for (double y = 2; y + 20 <= o.sizeY; y += 20)
        for (double x = 6; x + 16 <= o.sizeX; x += std::fmod(x, 60.0) > 37 ? 28 : 16) {
            const std::uint64_t key = static_cast<std::uint64_t>(x * 7919 + y * 104729);
            if (Hash01(key) < 0.15)
                continue;
            const double w = 8 + 6 * Hash01(key + 1), d = 8 + 8 * Hash01(key + 2);
            const double x0 = snap(x + (14 - w) * Hash01(key + 3)), y0 = snap(y + (16 - d) * Hash01(key + 4));
            const double u = Hash01(key + 5);
            const double height = Hash01(key + 6) < 0.06 ? 30 + 20 * u : 3 + 21 * u * u;
            o.buildings.push_back({x0, y0, snap(x0 + w), snap(y0 + d), std::round(height)});
        }
    for (unsigned int r = 0; r < rows; ++r)
        for (unsigned int c = 0; c < cols; ++c) {
            char name[32];
            std::snprintf(name, sizeof name, "r%02uc%02u", r + 1, c + 1);
            CameraSpec camera{name, r % 2 == 0 ? 90.0 : 270.0, 0.0, 1.2 * footprint,
                              imageSize, imageSize, gsd};
            camera.targetX = margin + footprint / 2 + c * base;
            camera.targetY = margin + footprint / 2 + r * spacing;
            o.cameras.push_back(camera);
        }
    return o;
}

double ExposureGain(const CityOptions& options, std::size_t index) {
    const double u = Hash01(options.seed * 0x9e3779b97f4a7c15ULL + 1000003u * (index + 1));
    return 1.0 + options.exposureSpread / 100.0 * (2 * u - 1);
}

std::vector<Building> PerturbedBuildings(const CityOptions& options) {
    std::vector<Building> buildings = options.buildings;
    if (options.dsmError == 0)
        return buildings;
    const double px = options.dsmPixel;
    for (std::size_t k = 0; k < buildings.size(); ++k) {
        Building& b = buildings[k];
        double* edges[4] = {&b.x0, &b.y0, &b.x1, &b.y1};
        for (int e = 0; e < 4; ++e) {
            const std::uint64_t key = options.seed * 0xbf58476d1ce4e5b9ULL + 4 * k + e;
            const double pixels =
                1 + std::min<double>(options.dsmError - 1, std::floor(Hash01(key) * options.dsmError));
            const double outward = e < 2 ? -1 : 1;
            *edges[e] += (Hash01(key + 0x51ed27) < 0.5 ? outward : -outward) * pixels * px;
        }
        // At least one pixel wide: a moved edge does not pass the opposite one.
        if (b.x1 - b.x0 < px)
            b.x1 = b.x0 + px;
        if (b.y1 - b.y0 < px)
            b.y1 = b.y0 + px;
    }
    return buildings;
}

// ---------------------------------------------------------------------------------------------
// Surface

Dsm::Dsm(const CityOptions& options) : options_(options) {
    if (!(options.dsmPixel > 0) || !(options.sizeX > 0) || !(options.sizeY > 0))
        KESTREL_THROW(DataException, "Sample city: sizes and DSM pixel must be positive");
    width_ = static_cast<unsigned int>(std::lround(options.sizeX / options.dsmPixel));
    height_ = static_cast<unsigned int>(std::lround(options.sizeY / options.dsmPixel));
    posts_.resize(static_cast<size_t>(width_) * height_);
    buildingIds_.assign(posts_.size(), 0);
    const double px = options.dsmPixel;
    for (unsigned int j = 0; j < height_; ++j)
        for (unsigned int i = 0; i < width_; ++i)
            posts_[static_cast<size_t>(j) * width_ + i] = static_cast<float>(Ground(
                options.west + (i + 0.5) * px, options.south + options.sizeY - (j + 0.5) * px));
    // Each building over the posts whose centres lie inside it.
    for (size_t k = 0; k < options.buildings.size(); ++k) {
        const Building& b = options.buildings[k];
        const double roof =
            Ground(options.west + (b.x0 + b.x1) / 2, options.south + (b.y0 + b.y1) / 2) + b.height;
        const int i0 = std::max(0, static_cast<int>(std::floor(b.x0 / px - 0.5)));
        const int i1 =
            std::min(static_cast<int>(width_) - 1, static_cast<int>(std::ceil(b.x1 / px)));
        const int j0 = std::max(0, static_cast<int>(std::floor((options.sizeY - b.y1) / px - 0.5)));
        const int j1 = std::min(static_cast<int>(height_) - 1,
                                static_cast<int>(std::ceil((options.sizeY - b.y0) / px)));
        for (int j = j0; j <= j1; ++j)
            for (int i = i0; i <= i1; ++i) {
                const double lx = (i + 0.5) * px, ly = options.sizeY - (j + 0.5) * px;
                if (!(lx > b.x0 && lx < b.x1 && ly > b.y0 && ly < b.y1))
                    continue;
                const size_t at = static_cast<size_t>(j) * width_ + i;
                if (roof > posts_[at])
                    posts_[at] = static_cast<float>(roof),
                    buildingIds_[at] = static_cast<int>(k) + 1;
            }
    }
    const auto range = std::minmax_element(posts_.begin(), posts_.end());
    minHeight_ = *range.first, maxHeight_ = *range.second;
    // The highest post of each block, then of the 3 x 3 blocks around it.
    blocksX_ = (width_ + kBlock - 1) / kBlock, blocksY_ = (height_ + kBlock - 1) / kBlock;
    std::vector<float> own(static_cast<size_t>(blocksX_) * blocksY_, -FLT_MAX);
    for (unsigned int j = 0; j < height_; ++j)
        for (unsigned int i = 0; i < width_; ++i) {
            float& m = own[(j / kBlock) * blocksX_ + i / kBlock];
            m = std::max(m, posts_[static_cast<size_t>(j) * width_ + i]);
        }
    blockMax_.assign(own.size(), -FLT_MAX);
    for (unsigned int bj = 0; bj < blocksY_; ++bj)
        for (unsigned int bi = 0; bi < blocksX_; ++bi)
            for (unsigned int nj = bj > 0 ? bj - 1 : 0; nj <= std::min(bj + 1, blocksY_ - 1); ++nj)
                for (unsigned int ni = bi > 0 ? bi - 1 : 0; ni <= std::min(bi + 1, blocksX_ - 1);
                     ++ni)
                    blockMax_[bj * blocksX_ + bi] =
                        std::max(blockMax_[bj * blocksX_ + bi], own[nj * blocksX_ + ni]);
}

float Dsm::NearbyMax(double x, double y) const {
    const double fx = (x - options_.west) / options_.dsmPixel;
    const double fy = (options_.south + options_.sizeY - y) / options_.dsmPixel;
    const auto bi = static_cast<unsigned int>(std::min(std::max(fx, 0.0), width_ - 1.0)) / kBlock;
    const auto bj = static_cast<unsigned int>(std::min(std::max(fy, 0.0), height_ - 1.0)) / kBlock;
    return blockMax_[static_cast<size_t>(bj) * blocksX_ + bi];
}

double Dsm::Ground(double x, double y) const {
    return options_.groundHeight + options_.slopeX * (x - options_.west) +
           options_.slopeY * (y - options_.south);
}

std::array<double, 6> Dsm::GeoTransform() const {
    return {options_.west, options_.dsmPixel, 0.0, options_.south + options_.sizeY,
            0.0,           -options_.dsmPixel};
}

double Dsm::HeightAt(double x, double y) const {
    double fx = (x - options_.west) / options_.dsmPixel - 0.5;
    double fy = (options_.south + options_.sizeY - y) / options_.dsmPixel - 0.5;
    fx = std::min(std::max(fx, 0.0), width_ - 1.0);
    fy = std::min(std::max(fy, 0.0), height_ - 1.0);
    const unsigned int i = std::min(static_cast<unsigned int>(fx), width_ - 2);
    const unsigned int j = std::min(static_cast<unsigned int>(fy), height_ - 2);
    const double ax = fx - i, ay = fy - j;
    const float* p = &posts_[static_cast<size_t>(j) * width_ + i];
    return (1 - ay) * ((1 - ax) * p[0] + ax * p[1]) +
           ay * ((1 - ax) * p[width_] + ax * p[width_ + 1]);
}

int Dsm::BuildingAt(double x, double y) const {
    const double fx = (x - options_.west) / options_.dsmPixel;
    const double fy = (options_.south + options_.sizeY - y) / options_.dsmPixel;
    if (!(fx >= 0 && fy >= 0 && fx < width_ && fy < height_))
        return 0;
    return buildingIds_[static_cast<size_t>(fy) * width_ + static_cast<size_t>(fx)];
}

bool Dsm::Intersect(const Vec3& origin, const Vec3& dir, Vec3& hit) const {
    if (dir[2] >= 0)
        return false;
    // Start where the ray comes down to the highest surface point.
    double t = std::max(0.0, (maxHeight_ + 0.01 - origin[2]) / dir[2]);
    const double step = 0.5 * options_.dsmPixel;
    const double east = options_.west + options_.sizeX, north = options_.south + options_.sizeY;
    auto above = [&](double tt) {
        const double x = origin[0] + tt * dir[0], y = origin[1] + tt * dir[1];
        return origin[2] + tt * dir[2] - HeightAt(x, y);
    };
    // Steps of half a DSM pixel across the ground (so that no wall is stepped over), or longer
    // ones while the ray stays above everything within (kBlock - 1) pixels.
    const double across = std::sqrt(dir[0] * dir[0] + dir[1] * dir[1]);
    const double fine = across > 0 ? step / across : HUGE_VAL;
    const double reach = across > 0 ? (kBlock - 1) * options_.dsmPixel / across : HUGE_VAL;
    double previous = t;
    for (;;) {
        const double x = origin[0] + t * dir[0], y = origin[1] + t * dir[1];
        if (x < options_.west || x > east || y < options_.south || y > north)
            return false;
        if (above(t) <= 0)
            break;
        const double z = origin[2] + t * dir[2];
        if (z < minHeight_ - 1)
            return false;
        previous = t;
        const double clearance = z - NearbyMax(x, y);
        t += std::max(fine, clearance > 0 ? std::min(clearance / -dir[2], reach) : 0.0);
    }
    // To a tenth of a millimetre along the ray.
    double lo = previous, hi = t;
    for (int k = 0; k < 60 && hi - lo > 1e-4; ++k) {
        const double mid = 0.5 * (lo + hi);
        (above(mid) > 0 ? lo : hi) = mid;
    }
    const double tt = 0.5 * (lo + hi);
    hit = {origin[0] + tt * dir[0], origin[1] + tt * dir[1], origin[2] + tt * dir[2]};
    return true;
}

void WriteDsm(const Dsm& dsm, const std::string& path) {
    GDALAllRegister();
    ErrorCapture errors;
    GDALDriver* driver = GetGDALDriverManager()->GetDriverByName("GTiff");
    const char* options[] = {"TILED=YES", "COMPRESS=DEFLATE", "PREDICTOR=3", nullptr};
    DatasetPtr ds(driver->Create(path.c_str(), static_cast<int>(dsm.Width()),
                                 static_cast<int>(dsm.Height()), 1, GDT_Float32,
                                 const_cast<char**>(options)));
    if (!ds)
        KESTREL_THROW(DataException, FormatString("%s: cannot create the DSM: %s", path.c_str(),
                                                  errors.Reason().c_str()));
    std::array<double, 6> gt = dsm.GeoTransform();
    ds->SetGeoTransform(gt.data());
    // The heights are ellipsoidal, and the CRS says so (a third axis, ellipsoidal height, kept
    // in the side file dsm.tif.aux.xml): a model read without --elevref takes them as they are.
    OGRSpatialReference crs(ICRS(dsm.Options().crs).GetSpatialReference());
    crs.PromoteTo3D(nullptr);
    ds->SetSpatialRef(&crs);
    GDALRasterBand* band = ds->GetRasterBand(1);
    band->SetNoDataValue(-32768.0);
    CheckWrite(band->RasterIO(GF_Write, 0, 0, static_cast<int>(dsm.Width()),
                              static_cast<int>(dsm.Height()),
                              const_cast<float*>(dsm.Posts().data()), static_cast<int>(dsm.Width()),
                              static_cast<int>(dsm.Height()), GDT_Float32, 0, 0, nullptr),
               path, errors);
    ds.reset();
}

// ---------------------------------------------------------------------------------------------
// Camera

FrameCamera::FrameCamera(const CameraSpec& spec, const Dsm& dsm) : spec_(spec) {
    const CityOptions& o = dsm.Options();
    const double cx = o.west + (std::isnan(spec.targetX) ? o.sizeX / 2 : spec.targetX);
    const double cy = o.south + (std::isnan(spec.targetY) ? o.sizeY / 2 : spec.targetY);
    const Vec3 target = {cx, cy, dsm.Ground(cx, cy)};
    const double az = spec.azimuthDegrees * kPi / 180, tilt = spec.offNadirDegrees * kPi / 180;
    const double horizontal = spec.altitude * std::tan(tilt);
    const Vec3 centre = {target[0] + horizontal * std::sin(az),
                         target[1] + horizontal * std::cos(az), target[2] + spec.altitude};
    // Axes in the local map frame at the centre: looking at the target, no roll; straight down,
    // the top of the image towards the azimuth.
    const Vec3 forward = Normalised(Sub(target, centre));
    const Vec3 right = tilt == 0.0 ? Vec3{std::cos(az), -std::sin(az), 0.0}
                                   : Normalised(Cross(forward, {0.0, 0.0, 1.0}));
    const Vec3 down = Cross(forward, right);
    intrinsics_.width = spec.width, intrinsics_.height = spec.height;
    intrinsics_.fx = intrinsics_.fy = spec.altitude / std::cos(tilt) / spec.groundSampleDistance;
    intrinsics_.cx = spec.width / 2.0 - 0.5, intrinsics_.cy = spec.height / 2.0 - 0.5;
    pose_.crs = o.crs;
    pose_.centre = centre;
    pose_.rotation = {right[0], right[1], right[2], down[0],    down[1],
                      down[2],  forward[0], forward[1], forward[2]};
    model_ = kestrel::mathmodel::MakeFrameCameraModel(intrinsics_, pose_, spec.name);
    top_ = dsm.MaxHeight() + 5, bottom_ = dsm.MinHeight() - 5;
}

bool FrameCamera::Project(double x, double y, double z, double& col, double& row) const {
    bool ok = false;
    model_->GroundToImage(1, &x, &y, &z, &col, &row, &ok);
    return ok;
}

void FrameCamera::Rays(std::size_t n, const double* col, const double* row, double* origins,
                       double* dirs) const {
    std::vector<double> heights(2 * n), x(2 * n), y(2 * n), c(2 * n), r(2 * n);
    std::copy(col, col + n, c.begin());
    std::copy(col, col + n, c.begin() + n);
    std::copy(row, row + n, r.begin());
    std::copy(row, row + n, r.begin() + n);
    std::fill(heights.begin(), heights.begin() + n, top_);
    std::fill(heights.begin() + n, heights.end(), bottom_);
    std::unique_ptr<bool[]> ok(new bool[2 * n]);
    model_->ImageToGround(2 * n, c.data(), r.data(), heights.data(), x.data(), y.data(), ok.get());
    for (std::size_t i = 0; i < n; ++i) {
        if (!ok[i] || !ok[n + i]) {
            std::fill(origins + 3 * i, origins + 3 * i + 3, NAN);
            std::fill(dirs + 3 * i, dirs + 3 * i + 3, NAN);
            continue;
        }
        const Vec3 d = Normalised({x[n + i] - x[i], y[n + i] - y[i], bottom_ - top_});
        origins[3 * i] = x[i], origins[3 * i + 1] = y[i], origins[3 * i + 2] = top_;
        dirs[3 * i] = d[0], dirs[3 * i + 1] = d[1], dirs[3 * i + 2] = d[2];
    }
}

void FrameCamera::Ray(double col, double row, Vec3& origin, Vec3& dir) const {
    Rays(1, &col, &row, origin.data(), dir.data());
    if (std::isnan(dir[0]))
        KESTREL_THROW(DataException,
                      FormatString("Sample city: camera %s has no line of sight at (%g, %g)",
                                   spec_.name.c_str(), col, row));
}

// ---------------------------------------------------------------------------------------------
// RPC

void Rpc::Evaluate(double lon, double lat, double h, double& samp, double& line) const {
    const auto t =
        Terms((lon - lonOff) / lonScale, (lat - latOff) / latScale, (h - heightOff) / heightScale);
    line = Poly(lineNum, t) / Poly(lineDen, t) * lineScale + lineOff;
    samp = Poly(sampNum, t) / Poly(sampDen, t) * sampScale + sampOff;
}

std::vector<std::string> Rpc::ToMetadata() const {
    auto number = [](const char* name, double v) { return FormatString("%s=%.17g", name, v); };
    auto list = [](const char* name, const std::array<double, 20>& c) {
        std::string s = std::string(name) + "=";
        for (int k = 0; k < 20; ++k)
            s += FormatString(k ? " %.17g" : "%.17g", c[k]);
        return s;
    };
    return {number("LINE_OFF", lineOff),     number("SAMP_OFF", sampOff),
            number("LAT_OFF", latOff),       number("LONG_OFF", lonOff),
            number("HEIGHT_OFF", heightOff), number("LINE_SCALE", lineScale),
            number("SAMP_SCALE", sampScale), number("LAT_SCALE", latScale),
            number("LONG_SCALE", lonScale),  number("HEIGHT_SCALE", heightScale),
            list("LINE_NUM_COEFF", lineNum), list("LINE_DEN_COEFF", lineDen),
            list("SAMP_NUM_COEFF", sampNum), list("SAMP_DEN_COEFF", sampDen)};
}

Rpc Rpc::FromMetadata(const std::vector<std::string>& items) {
    auto find = [&](const char* name) {
        const std::string prefix = std::string(name) + "=";
        for (const std::string& item : items)
            if (item.compare(0, prefix.size(), prefix) == 0)
                return item.substr(prefix.size());
        KESTREL_THROW(DataException, FormatString("RPC metadata without %s", name));
    };
    auto number = [&](const char* name) { return std::atof(find(name).c_str()); };
    auto list = [&](const char* name, std::array<double, 20>& c) {
        const std::string text = find(name);
        const char* p = text.c_str();
        for (int k = 0; k < 20; ++k) {
            char* end = nullptr;
            c[k] = std::strtod(p, &end);
            if (end == p)
                KESTREL_THROW(DataException,
                              FormatString("RPC metadata %s holds fewer than 20 numbers", name));
            p = end;
        }
    };
    Rpc r;
    r.lineOff = number("LINE_OFF"), r.sampOff = number("SAMP_OFF");
    r.latOff = number("LAT_OFF"), r.lonOff = number("LONG_OFF");
    r.heightOff = number("HEIGHT_OFF"), r.lineScale = number("LINE_SCALE");
    r.sampScale = number("SAMP_SCALE"), r.latScale = number("LAT_SCALE");
    r.lonScale = number("LONG_SCALE"), r.heightScale = number("HEIGHT_SCALE");
    list("LINE_NUM_COEFF", r.lineNum), list("LINE_DEN_COEFF", r.lineDen);
    list("SAMP_NUM_COEFF", r.sampNum), list("SAMP_DEN_COEFF", r.sampDen);
    return r;
}

Rpc FitRpc(const FrameCamera& camera, const ICRS& crs, double minHeight, double maxHeight,
           double* maxResidual) {
    const ICRS wgs84("EPSG:4326");
    const CoordinateTransformation toGeographic(crs, wgs84);
    const double width = camera.Spec().width, height = camera.Spec().height;
    const double h0 = minHeight - 10, h1 = maxHeight + 10;

    // Ground points of an image grid at several heights: where each ray crosses each height.
    auto sample = [&](int nGrid, int nHeights, double shift, std::vector<double>& lon,
                      std::vector<double>& lat, std::vector<double>& h, std::vector<double>& col,
                      std::vector<double>& row) {
        for (int a = 0; a < nGrid; ++a)
            for (int b = 0; b < nGrid; ++b)
                for (int k = 0; k < nHeights; ++k) {
                    const double c = width * (a + shift) / (nGrid - 1 + 2 * shift);
                    const double r = height * (b + shift) / (nGrid - 1 + 2 * shift);
                    const double z = h0 + (h1 - h0) * (k + shift) / (nHeights - 1 + 2 * shift);
                    h.push_back(z);
                    col.push_back(c);
                    row.push_back(r);
                }
        lon.resize(h.size()), lat.resize(h.size());
        std::unique_ptr<bool[]> ok(new bool[h.size()]);
        camera.Model().ImageToGround(h.size(), col.data(), row.data(), h.data(), lon.data(),
                                     lat.data(), ok.get());
        if (!std::all_of(ok.get(), ok.get() + h.size(), [](bool b) { return b; }) ||
            !toGeographic.Transform(lon.size(), lon.data(), lat.data()))
            KESTREL_THROW(DataException, "RPC fit: ground points outside the coordinate system");
    };
    std::vector<double> lon, lat, h, col, row;
    sample(15, 7, 0.0, lon, lat, h, col, row);

    Rpc r;
    auto range = [](const std::vector<double>& v, double& off, double& scale) {
        const auto mm = std::minmax_element(v.begin(), v.end());
        off = 0.5 * (*mm.first + *mm.second);
        scale = std::max(0.5 * (*mm.second - *mm.first), 1e-9);
    };
    range(lon, r.lonOff, r.lonScale);
    range(lat, r.latOff, r.latScale);
    range(h, r.heightOff, r.heightScale);
    r.lineOff = height / 2 - 0.5, r.lineScale = height / 2;
    r.sampOff = width / 2 - 0.5, r.sampScale = width / 2;

    std::vector<std::array<double, 20>> terms;
    std::vector<double> lines, samps;
    for (size_t i = 0; i < lon.size(); ++i) {
        terms.push_back(Terms((lon[i] - r.lonOff) / r.lonScale, (lat[i] - r.latOff) / r.latScale,
                              (h[i] - r.heightOff) / r.heightScale));
        lines.push_back((row[i] - 0.5 - r.lineOff) / r.lineScale);
        samps.push_back((col[i] - 0.5 - r.sampOff) / r.sampScale);
    }
    FitRatio(terms, lines, r.lineNum, r.lineDen);
    FitRatio(terms, samps, r.sampNum, r.sampDen);

    if (maxResidual != nullptr) {
        // Checked between the fit points.
        std::vector<double> clon, clat, ch, ccol, crow;
        sample(14, 6, 0.5, clon, clat, ch, ccol, crow);
        double worst = 0;
        for (size_t i = 0; i < clon.size(); ++i) {
            double s, l;
            r.Evaluate(clon[i], clat[i], ch[i], s, l);
            worst = std::max(worst, std::hypot(s + 0.5 - ccol[i], l + 0.5 - crow[i]));
        }
        *maxResidual = worst;
    }
    return r;
}

// ---------------------------------------------------------------------------------------------
// Texture and rendering

std::array<std::uint8_t, 3> Texture(const Dsm& dsm, double x, double y, double z,
                                    std::uint64_t seed) {
    const double phase = Hash01(seed) * 2 * kPi;
    const double e = 0.05 * dsm.Options().dsmPixel;
    const double gx = (dsm.HeightAt(x + e, y) - dsm.HeightAt(x - e, y)) / (2 * e);
    const double gy = (dsm.HeightAt(x, y + e) - dsm.HeightAt(x, y - e)) / (2 * e);
    if (gx * gx + gy * gy > 1.5 * 1.5) {  // a wall: horizontal courses
        const double v = 95 + 25 * std::sin(z * 1.9 + phase) + 10 * std::sin((x + y) * 0.7);
        return {ToByte(v), ToByte(v - 5), ToByte(v - 10)};
    }
    if (z > dsm.Ground(x, y) + 1.0) {  // a roof: its building's colour, softly patterned
        const int id = dsm.BuildingAt(x, y);
        const double base = 120 + 80 * Hash01(seed * 31 + static_cast<std::uint64_t>(id));
        const double p = 12 * std::sin(x * 0.9 + phase) * std::sin(y * 0.8);
        return {ToByte(base + p), ToByte(255 - base + p), ToByte(90 + 60 * Hash01(id + 5u) + p)};
    }
    // Ground: smooth fields with a darker street grid.
    const double field = 40 * std::sin(x / 7.3 + phase) * std::cos(y / 9.1) +
                         18 * std::sin((x + 2 * y) / 4.1) + 10 * std::cos((x - y) / 2.3);
    const double street =
        0.5 +
        0.5 * std::tanh((std::fabs(std::fmod(x - dsm.Options().west, 60.0) - 30.0) - 26.0) / 1.2);
    const double v = 125 + field - 55 * street;
    return {ToByte(v * 0.85), ToByte(v + 8), ToByte(v * 0.7 + 20)};
}

namespace {

// Runs rowWork(row) for rows 0 .. rows - 1 on `threads` threads (0: the hardware's count).
template <typename RowWork>
void ForEachRow(unsigned int rows, unsigned int threads, const RowWork& rowWork) {
    std::atomic<unsigned int> nextRow{0};
    auto work = [&] {
        for (unsigned int r; (r = nextRow++) < rows;)
            rowWork(r);
    };
    if (threads == 0)
        threads = std::max(1u, std::thread::hardware_concurrency());
    std::vector<std::thread> pool;
    for (unsigned int t = 1; t < threads; ++t)
        pool.emplace_back(work);
    work();
    for (auto& t : pool)
        t.join();
}

// Writes width x height pixel-interleaved RGB bytes as a tiled GeoTIFF with no-data 0 (DEFLATE
// when georeferenced: the ideal image is large and mostly smooth); the metadata items
// (NAME=VALUE) go into the given domain.
void WriteRgb(const std::string& path, const std::vector<std::uint8_t>& pixels, unsigned int w,
              unsigned int h, const std::array<double, 6>* geoTransform, const ICRS* crs,
              std::vector<std::string> metadata, const char* domain) {
    ErrorCapture errors;
    GDALDriver* driver = GetGDALDriverManager()->GetDriverByName("GTiff");
    const char* options[] = {"TILED=YES", "INTERLEAVE=PIXEL", "PHOTOMETRIC=RGB",
                             geoTransform != nullptr ? "COMPRESS=DEFLATE" : nullptr, nullptr};
    DatasetPtr ds(driver->Create(path.c_str(), static_cast<int>(w), static_cast<int>(h), 3,
                                 GDT_Byte, const_cast<char**>(options)));
    if (!ds)
        KESTREL_THROW(DataException, FormatString("%s: cannot create the image: %s", path.c_str(),
                                                  errors.Reason().c_str()));
    if (geoTransform != nullptr) {
        std::array<double, 6> gt = *geoTransform;
        ds->SetGeoTransform(gt.data());
    }
    if (crs != nullptr)
        ds->SetSpatialRef(&crs->GetSpatialReference());
    if (!metadata.empty()) {
        std::vector<char*> list;
        for (auto& item : metadata)
            list.push_back(&item[0]);
        list.push_back(nullptr);
        ds->SetMetadata(list.data(), domain);
    }
    for (int b = 1; b <= 3; ++b)
        ds->GetRasterBand(b)->SetNoDataValue(0);
    int bands[] = {1, 2, 3};
    CheckWrite(ds->RasterIO(GF_Write, 0, 0, static_cast<int>(w), static_cast<int>(h),
                            const_cast<std::uint8_t*>(pixels.data()), static_cast<int>(w),
                            static_cast<int>(h), GDT_Byte, 3, bands, 3, 3 * static_cast<GSpacing>(w),
                            1, nullptr),
               path, errors);
    ds.reset();
}

// A texture colour times the exposure gain, kept off 0 (the background and no-data value).
void PutColour(std::uint8_t* p, const std::array<std::uint8_t, 3>& rgb, double gain) {
    for (int k = 0; k < 3; ++k)
        p[k] = std::max<std::uint8_t>(gain == 1.0 ? rgb[k] : ToByte(rgb[k] * gain), 1);
}

void RenderImage(const FrameCamera& camera, const Dsm& dsm, const Rpc& rpc, const std::string& path,
                 std::uint64_t seed, double gain, unsigned int threads) {
    const unsigned int w = camera.Spec().width, h = camera.Spec().height;
    std::vector<std::uint8_t> pixels(static_cast<size_t>(w) * h * 3, 0);
    ForEachRow(h, threads, [&](unsigned int r) {
        std::vector<double> cols(w), rows(w, r + 0.5), origins(3 * w), dirs(3 * w);
        for (unsigned int c = 0; c < w; ++c)
            cols[c] = c + 0.5;
        camera.Rays(w, cols.data(), rows.data(), origins.data(), dirs.data());
        for (unsigned int c = 0; c < w; ++c) {
            const Vec3 o = {origins[3 * c], origins[3 * c + 1], origins[3 * c + 2]};
            const Vec3 d = {dirs[3 * c], dirs[3 * c + 1], dirs[3 * c + 2]};
            Vec3 hit;
            if (std::isnan(d[0]) || !dsm.Intersect(o, d, hit))
                continue;  // off the surface model: background 0
            PutColour(&pixels[(static_cast<size_t>(r) * w + c) * 3],
                      Texture(dsm, hit[0], hit[1], hit[2], seed), gain);
        }
    });
    WriteRgb(path, pixels, w, h, nullptr, nullptr, rpc.ToMetadata(), "RPC");
}

void WriteText(const std::string& path, const std::string& text, const char* what) {
    std::ofstream out(path, std::ios::binary);
    if (!(out << text).flush())
        KESTREL_THROW(DataException, FormatString("%s: cannot write the %s", path.c_str(), what));
}

std::string JsonString(const std::string& s) {
    std::string out = "\"";
    for (const char c : s) {
        if (c == '"' || c == '\\')
            out += '\\', out += c;
        else if (static_cast<unsigned char>(c) < 0x20)
            out += FormatString("\\u%04x", c);
        else
            out += c;
    }
    return out + "\"";
}

}  // namespace

std::vector<std::uint8_t> RenderIdeal(const Dsm& dsm, const std::array<double, 6>& gt,
                                      unsigned int width, unsigned int height, std::uint64_t seed,
                                      unsigned int threads) {
    std::vector<std::uint8_t> pixels(static_cast<size_t>(width) * height * 3, 0);
    const CityOptions& o = dsm.Options();
    ForEachRow(height, threads, [&](unsigned int r) {
        for (unsigned int c = 0; c < width; ++c) {
            const double x = gt[0] + (c + 0.5) * gt[1] + (r + 0.5) * gt[2];
            const double y = gt[3] + (c + 0.5) * gt[4] + (r + 0.5) * gt[5];
            if (x < o.west || x > o.west + o.sizeX || y < o.south || y > o.south + o.sizeY)
                continue;
            PutColour(&pixels[(static_cast<size_t>(r) * width + c) * 3],
                      Texture(dsm, x, y, dsm.HeightAt(x, y), seed), 1.0);
        }
    });
    return pixels;
}

Sample MakeSample(const std::string& directory, const CityOptions& options, unsigned int threads) {
    GDALAllRegister();
    if (!(options.exposureSpread >= 0 && options.exposureSpread < 100))
        KESTREL_THROW(DataException,
                      FormatString("Sample city: the exposure spread must be from 0 to under 100 "
                                   "per cent, not %g",
                                   options.exposureSpread));
    const Dsm dsm(options);
    const ICRS crs(options.crs);
    Sample sample;
    sample.dsmPath = directory + "/dsm.tif";
    sample.trueDsmPath = sample.dsmPath;
    if (options.dsmError > 0) {
        CityOptions handed = options;
        handed.buildings = PerturbedBuildings(options);
        WriteDsm(Dsm(handed), sample.dsmPath);
        sample.trueDsmPath = directory + "/dsm_true.tif";
    }
    WriteDsm(dsm, sample.trueDsmPath);
    for (size_t i = 0; i < options.cameras.size(); ++i) {
        SampleImage image;
        image.camera = std::make_unique<FrameCamera>(options.cameras[i], dsm);
        const Rpc rpc =
            FitRpc(*image.camera, crs, dsm.MinHeight(), dsm.MaxHeight(), &image.rpcMaxResidual);
        image.path = directory + "/" + options.cameras[i].name + ".tif";
        image.gain = ExposureGain(options, i);
        RenderImage(*image.camera, dsm, rpc, image.path, options.seed, image.gain, threads);
        image.cameraPath = kestrel::mathmodel::CameraSideFile(image.path);
        kestrel::mathmodel::WriteCameraFile(image.cameraPath, image.camera->Intrinsics(),
                                            image.camera->Pose());
        sample.images.push_back(std::move(image));
    }
    auto fileName = [](const std::string& path) {
        return std::filesystem::path(path).filename().string();
    };
    // The same cameras as an exterior-orientation table, each row naming its image's side file
    // as its interior orientation.
    {
        std::string table = "# image X Y Z omega phi kappa camera (" + options.crs + ")\n";
        for (const SampleImage& image : sample.images) {
            const auto& c = image.camera->Pose().centre;
            const auto opk = kestrel::mathmodel::OpkFromRotation(image.camera->Pose().rotation);
            table += FormatString("%s %.6f %.6f %.6f %.12f %.12f %.12f %s\n",
                                  fileName(image.path).c_str(), c[0], c[1], c[2], opk[0], opk[1],
                                  opk[2], fileName(image.cameraPath).c_str());
        }
        WriteText(directory + "/cameras.txt", table, "exterior-orientation table");
    }
    // The ideal image on a grid of whole pixels from the DSM's north-west corner.
    std::string idealGrid = "null";
    if (options.idealPixel > 0) {
        const auto w = static_cast<unsigned int>(std::ceil(options.sizeX / options.idealPixel - 1e-9));
        const auto h = static_cast<unsigned int>(std::ceil(options.sizeY / options.idealPixel - 1e-9));
        const std::array<double, 6> gt = {options.west, options.idealPixel, 0.0,
                                          options.south + options.sizeY, 0.0, -options.idealPixel};
        sample.idealPath = directory + "/ideal.tif";
        WriteRgb(sample.idealPath, RenderIdeal(dsm, gt, w, h, options.seed, threads), w, h, &gt,
                 &crs, {}, nullptr);
        idealGrid = FormatString("{\"width\": %u, \"height\": %u, \"geotransform\": [%.17g, "
                                 "%.12g, 0, %.12g, 0, %.12g]}",
                                 w, h, gt[0], gt[1], gt[3], gt[5]);
    }
    // What made the sample, for benchmarks and measurements.
    {
        std::string notes = "{\n";
        notes += FormatString("  \"crs\": %s,\n  \"seed\": %llu,\n", JsonString(options.crs).c_str(),
                              static_cast<unsigned long long>(options.seed));
        notes += FormatString("  \"exposure_spread\": %.17g,\n  \"dsm_error\": %u,\n",
                              options.exposureSpread, options.dsmError);
        notes += FormatString("  \"dsm_pixel\": %.12g,\n  \"buildings\": %zu,\n", options.dsmPixel,
                              options.buildings.size());
        notes += "  \"dsm\": " + JsonString(fileName(sample.dsmPath)) +
                 ",\n  \"dsm_true\": " + JsonString(fileName(sample.trueDsmPath)) + ",\n";
        notes += "  \"ideal\": " +
                 (sample.idealPath.empty() ? std::string("null") : JsonString(fileName(sample.idealPath))) +
                 ",\n  \"ideal_grid\": " + idealGrid + ",\n  \"images\": [";
        for (size_t i = 0; i < sample.images.size(); ++i) {
            const SampleImage& image = sample.images[i];
            notes += FormatString("%s\n    {\"name\": %s, \"image\": %s, \"gain\": %.17g, "
                                  "\"gsd\": %.12g, \"rpc_max_residual\": %.6g}",
                                  i ? "," : "", JsonString(options.cameras[i].name).c_str(),
                                  JsonString(fileName(image.path)).c_str(), image.gain,
                                  options.cameras[i].groundSampleDistance, image.rpcMaxResidual);
        }
        notes += "\n  ]\n}\n";
        sample.notesPath = directory + "/sample.json";
        WriteText(sample.notesPath, notes, "sample notes");
    }
    // The master parameter file: fili; dbic; mmseg; dbiw; srcBgd; edgeClip; radioDif; dbmPxErr;
    // role. The radiometric levels differ so that the fill order shows. Written last: a sample
    // with its master file is whole.
    std::string master =
        "!MFILE sample city: fili;dbic;mmseg;dbiw;srcBgd;edgeClip;radioDif;dbmPxErr;role\n";
    const char* levels[] = {"LOW", "LOW", "MODERATE", "HIGH"};
    // The images lie beside the master file: their names alone, so that the directory can be
    // moved and read from any working directory.
    for (size_t i = 0; i < sample.images.size(); ++i)
        master += options.cameras[i].name + ".tif;1,2,3;0;;0;0;" + levels[i % 4] + ";1;ORTHO\n";
    sample.masterPath = directory + "/master.txt";
    WriteText(sample.masterPath, master, "master file");
    return sample;
}

// ---------------------------------------------------------------------------------------------
// Surface and model for tests

GridSurface::GridSurface(const std::string& path) {
    DatasetPtr ds = OpenRaster(path);
    std::array<double, 6> gt;
    if (ds->GetGeoTransform(gt.data()) != CE_None)
        KESTREL_THROW(DataException, FormatString("%s: no geotransform", path.c_str()));
    geocoding_ = kestrel::ogc::cs::GeocodingInfo(gt);
    if (const OGRSpatialReference* srs = ds->GetSpatialRef())
        crs_ = std::make_unique<ICRS>(*srs);
    width_ = static_cast<unsigned int>(ds->GetRasterXSize());
    height_ = static_cast<unsigned int>(ds->GetRasterYSize());
    posts_.resize(static_cast<size_t>(width_) * height_);
    GDALRasterBand* band = ds->GetRasterBand(1);
    if (band->RasterIO(GF_Read, 0, 0, static_cast<int>(width_), static_cast<int>(height_),
                       posts_.data(), static_cast<int>(width_), static_cast<int>(height_),
                       GDT_Float32, 0, 0, nullptr) != CE_None)
        KESTREL_THROW(DataException, FormatString("%s: cannot read the heights", path.c_str()));
    int hasNoData = 0;
    const double noData = band->GetNoDataValue(&hasNoData);
    if (hasNoData)
        for (float& v : posts_)
            if (v == static_cast<float>(noData))
                v = NAN;
}

GridSurface::~GridSurface() = default;

void GridSurface::GetExtent(double& minX, double& minY, double& maxX, double& maxY) const {
    double x0, y0, x1, y1;
    geocoding_.PixelToGround(0, 0, x0, y0);
    geocoding_.PixelToGround(width_, height_, x1, y1);
    minX = std::min(x0, x1), maxX = std::max(x0, x1);
    minY = std::min(y0, y1), maxY = std::max(y0, y1);
}

void GridSurface::SetInputCRS(const ICRS* crs) {
    input_.reset();
    if (crs != nullptr && crs_ && !crs->IsSame(*crs_))
        input_ = std::make_unique<CoordinateTransformation>(*crs, *crs_);
}

void GridSurface::GetHeights(std::size_t n, const double* x, const double* y,
                             double* heights) const {
    std::vector<double> tx, ty;
    if (input_) {
        tx.assign(x, x + n), ty.assign(y, y + n);
        CoordinateTransformation(*input_).Transform(n, tx.data(), ty.data());
        x = tx.data(), y = ty.data();
    }
    for (std::size_t k = 0; k < n; ++k) {
        double px, py;
        geocoding_.GroundToPixel(x[k], y[k], px, py);
        if (!(px >= 0 && py >= 0 && px <= width_ && py <= height_)) {
            heights[k] = NAN;
            continue;
        }
        const double fx = std::min(std::max(px - 0.5, 0.0), width_ - 1.0);
        const double fy = std::min(std::max(py - 0.5, 0.0), height_ - 1.0);
        const unsigned int i = std::min(static_cast<unsigned int>(fx), width_ > 1 ? width_ - 2 : 0);
        const unsigned int j =
            std::min(static_cast<unsigned int>(fy), height_ > 1 ? height_ - 2 : 0);
        const double ax = fx - i, ay = fy - j;
        double sum = 0, weight = 0;
        const double w[4] = {(1 - ax) * (1 - ay), ax * (1 - ay), (1 - ax) * ay, ax * ay};
        const unsigned int di[4] = {0, 1, 0, 1}, dj[4] = {0, 0, 1, 1};
        for (int q = 0; q < 4; ++q) {
            const unsigned int ii = std::min(i + di[q], width_ - 1);
            const unsigned int jj = std::min(j + dj[q], height_ - 1);
            const float v = posts_[static_cast<size_t>(jj) * width_ + ii];
            if (w[q] > 0 && !std::isnan(v))
                sum += w[q] * v, weight += w[q];
        }
        heights[k] = weight > 0 ? sum / weight : NAN;
    }
}

RpcModel::RpcModel(const std::string& imagePath) {
    DatasetPtr ds = OpenRaster(imagePath);
    std::vector<std::string> items;
    if (char** md = ds->GetMetadata("RPC"))
        for (char** p = md; *p != nullptr; ++p)
            items.emplace_back(*p);
    if (items.empty())
        KESTREL_THROW(DataException, FormatString("%s: no RPC metadata", imagePath.c_str()));
    rpc_ = Rpc::FromMetadata(items);
    width_ = static_cast<unsigned int>(ds->GetRasterXSize());
    height_ = static_cast<unsigned int>(ds->GetRasterYSize());
    crs_ = std::make_unique<ICRS>("EPSG:4979");
}

RpcModel::~RpcModel() = default;

void RpcModel::GroundToImage(std::size_t n, const double* x, const double* y, const double* z,
                             double* pixel, double* line, bool* ok) const {
    for (std::size_t k = 0; k < n; ++k) {
        double s, l;
        rpc_.Evaluate(x[k], y[k], z[k], s, l);
        pixel[k] = s + 0.5, line[k] = l + 0.5;
        ok[k] = std::isfinite(s) && std::isfinite(l);
    }
}

void RpcModel::ImageToGround(std::size_t n, const double* pixel, const double* line,
                             const double* z, double* x, double* y, bool* ok) const {
    for (std::size_t k = 0; k < n; ++k) {
        double lon = rpc_.lonOff, lat = rpc_.latOff;
        ok[k] = false;
        for (int it = 0; it < 30; ++it) {
            double s, l, s1, l1, s2, l2;
            rpc_.Evaluate(lon, lat, z[k], s, l);
            const double dl = 1e-3 * rpc_.lonScale, dp = 1e-3 * rpc_.latScale;
            rpc_.Evaluate(lon + dl, lat, z[k], s1, l1);
            rpc_.Evaluate(lon, lat + dp, z[k], s2, l2);
            const double a = (s1 - s) / dl, b = (s2 - s) / dp, c = (l1 - l) / dl, d = (l2 - l) / dp;
            const double det = a * d - b * c;
            if (det == 0 || !std::isfinite(det))
                break;
            const double es = pixel[k] - 0.5 - s, el = line[k] - 0.5 - l;
            lon += (d * es - b * el) / det;
            lat += (-c * es + a * el) / det;
            if (std::hypot(es, el) < 1e-6) {
                ok[k] = true;
                break;
            }
        }
        x[k] = lon, y[k] = lat;
    }
}

}  // namespace samplecity
