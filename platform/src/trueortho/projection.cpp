// The grid-to-image projection of the generators: exact on a lattice, interpolated in between.
#include <kestrel/trueortho.h>

#include <algorithm>
#include <cmath>
#include <limits>
#include <memory>
#include <vector>

namespace kestrel {
namespace processes {

namespace {

// Lattices coarser than this gain nothing on a tile; finer than 2 cost more than exact pixels.
constexpr int kFirstStep = 32;
constexpr int kMaxLevels = 33;

// Height is interpolated by a parabola through three neighbouring levels (pieces of two
// intervals): a frame camera's or an RPC model's image position is a ratio of functions of
// height whose curvature a straight line between levels would follow only at many levels.
// Piece and Lagrange weights of level position u (in intervals, 0 to levels - 1).
inline int Piece(double u, int levels) {
    return std::max(0, std::min(static_cast<int>(u / 2), (levels - 3) / 2));
}
inline void HeightWeights(double t, double& w0, double& w1, double& w2) {
    w0 = (t - 1) * (t - 2) / 2, w1 = t * (2 - t), w2 = t * (t - 1) / 2;
}

}  // namespace

struct GridProjection::Impl {
    const ogc::cs::GeocodingInfo& grid;
    const mathmodel::IMathModel& model;
    const ogc::cs::CoordinateTransformation* toModel;
    double maxError;
    int lastStep = 0, lastLevels = 0;
    // Scratch for exact projections, and the lattice: node image positions, level after level
    // within each node.
    std::vector<double> x, y, z, c, r;
    std::unique_ptr<bool[]> ok;
    size_t okSize = 0;
    std::vector<double> nodeCol, nodeRow;
    std::vector<int> cellOf;
    std::vector<double> fractionOf;

    Impl(const ogc::cs::GeocodingInfo& g, const mathmodel::IMathModel& m,
         const ogc::cs::CoordinateTransformation* t, double e)
        : grid(g), model(m), toModel(t), maxError(e) {}

    void Reserve(size_t n) {
        x.resize(n), y.resize(n), z.resize(n), c.resize(n), r.resize(n);
        if (okSize < n)
            ok.reset(new bool[n]), okSize = n;
    }

    // Projects the n grid positions (pixel, line) already in x and y at heights z into c and r;
    // false unless every point has a finite answer.
    bool Exact(size_t n) {
        for (size_t k = 0; k < n; ++k)
            grid.PixelToGround(x[k], y[k], x[k], y[k]);
        if (toModel != nullptr)
            toModel->Transform(n, x.data(), y.data());
        model.GroundToImage(n, x.data(), y.data(), z.data(), c.data(), r.data(), ok.get());
        bool all = true;
        for (size_t k = 0; k < n; ++k) {
            ok[k] = ok[k] && std::isfinite(c[k]) && std::isfinite(r[k]);
            all = all && ok[k];
        }
        return all;
    }

    void ExactWindow(int x0, int y0, int width, int height, const double* h, double* col,
                     double* row, bool* good) {
        const size_t n = static_cast<size_t>(width) * height;
        Reserve(n);
        for (int j = 0; j < height; ++j)
            for (int i = 0; i < width; ++i) {
                const size_t k = static_cast<size_t>(j) * width + i;
                x[k] = x0 + i + 0.5, y[k] = y0 + j + 0.5, z[k] = std::isfinite(h[k]) ? h[k] : 0;
            }
        Exact(n);
        for (size_t k = 0; k < n; ++k) {
            good[k] = ok[k] && std::isfinite(h[k]);
            col[k] = c[k], row[k] = r[k];
        }
        lastStep = 0, lastLevels = 0;
    }

    bool Lattice(int x0, int y0, int nx, int ny, int step, int levels, double low, double dh,
                 double& errorGrid, double& errorHeight, double& errorBoth);
};

// Projects the lattice's nodes exactly and measures the interpolation error at the checks.
bool GridProjection::Impl::Lattice(int x0, int y0, int nx, int ny, int step, int levels,
                                   double low, double dh, double& errorGrid, double& errorHeight,
                                   double& errorBoth) {
    const size_t nodes = static_cast<size_t>(nx) * ny;
    const size_t cells = static_cast<size_t>(nx - 1) * (ny - 1);
    // Nodes at every level, then the checks: cell centres at levels and mid-levels, the cells'
    // top and left edge midpoints at levels, nodes at mid-levels.
    const size_t mids = static_cast<size_t>(levels - 1);
    const size_t total = nodes * levels + cells * (levels + mids) +
                         2 * cells * levels + nodes * mids;
    Reserve(total);
    size_t k = 0;
    auto add = [&](double p, double l, double h) {
        x[k] = x0 + 0.5 + p * step, y[k] = y0 + 0.5 + l * step, z[k] = h, ++k;
    };
    for (int j = 0; j < ny; ++j)
        for (int i = 0; i < nx; ++i)
            for (int v = 0; v < levels; ++v)
                add(i, j, low + v * dh);
    for (int j = 0; j + 1 < ny; ++j)
        for (int i = 0; i + 1 < nx; ++i) {
            for (int v = 0; v < 2 * levels - 1; ++v)
                add(i + 0.5, j + 0.5, low + v * dh / 2);
            for (int v = 0; v < levels; ++v)
                add(i + 0.5, j, low + v * dh), add(i, j + 0.5, low + v * dh);
        }
    for (int j = 0; j < ny; ++j)
        for (int i = 0; i < nx; ++i)
            for (int v = 0; v + 1 < levels; ++v)
                add(i, j, low + (v + 0.5) * dh);
    if (!Exact(total))
        return false;
    nodeCol.assign(c.begin(), c.begin() + nodes * levels);
    nodeRow.assign(r.begin(), r.begin() + nodes * levels);

    // The interpolated position at lattice position (p, l) (halves allowed) and level v (halves
    // allowed) against the exact one at check k.
    auto at = [&](int i, int j, int v, double& col, double& row) {
        const size_t n = (static_cast<size_t>(j) * nx + i) * levels + v;
        col = nodeCol[n], row = nodeRow[n];
    };
    auto interpolated = [&](double p, double l, double v, double& col, double& row) {
        const int i = std::min(static_cast<int>(p), nx - 2), j = std::min(static_cast<int>(l), ny - 2);
        const int w = 2 * Piece(v, levels);
        const double fp = p - i, fl = l - j;
        double wv[3];
        HeightWeights(v - w, wv[0], wv[1], wv[2]);
        col = row = 0;
        for (int dv = 0; dv < 3; ++dv)
            for (int dj = 0; dj < 2; ++dj)
                for (int di = 0; di < 2; ++di) {
                    const double weight = (di ? fp : 1 - fp) * (dj ? fl : 1 - fl) * wv[dv];
                    if (weight == 0)
                        continue;
                    double nc, nr;
                    at(i + di, j + dj, w + dv, nc, nr);
                    col += weight * nc, row += weight * nr;
                }
    };
    errorGrid = errorHeight = errorBoth = 0;
    auto check = [&](double p, double l, double v, double& error) {
        double col, row;
        interpolated(p, l, v, col, row);
        error = std::max(error, std::hypot(col - c[k], row - r[k]));
        ++k;
    };
    k = nodes * levels;
    for (int j = 0; j + 1 < ny; ++j)
        for (int i = 0; i + 1 < nx; ++i) {
            for (int v = 0; v < 2 * levels - 1; ++v)
                check(i + 0.5, j + 0.5, v / 2.0, v % 2 ? errorBoth : errorGrid);
            for (int v = 0; v < levels; ++v) {
                check(i + 0.5, j, v, errorGrid);
                check(i, j + 0.5, v, errorGrid);
            }
        }
    for (int j = 0; j < ny; ++j)
        for (int i = 0; i < nx; ++i)
            for (int v = 0; v + 1 < levels; ++v)
                check(i, j, v + 0.5, errorHeight);
    return true;
}

GridProjection::GridProjection(const ogc::cs::GeocodingInfo& grid,
                               const mathmodel::IMathModel& model,
                               const ogc::cs::CoordinateTransformation* toModel, double maxError)
    : impl_(std::make_unique<Impl>(grid, model, toModel, maxError)) {}

GridProjection::~GridProjection() = default;

int GridProjection::LastStep() const { return impl_->lastStep; }
int GridProjection::LastLevels() const { return impl_->lastLevels; }

void GridProjection::Project(int x0, int y0, int width, int height, const double* h,
                             double* col, double* row, bool* good) {
    Impl& m = *impl_;
    const size_t n = static_cast<size_t>(std::max(width, 0)) * std::max(height, 0);
    if (n == 0)
        return;
    double low = std::numeric_limits<double>::infinity(), high = -low;
    for (size_t k = 0; k < n; ++k)
        if (std::isfinite(h[k]))
            low = std::min(low, h[k]), high = std::max(high, h[k]);
    if (!(low <= high)) {
        std::fill(good, good + n, false);
        return;
    }
    if (!(m.maxError > 0) || width < 4 || height < 4)
        return m.ExactWindow(x0, y0, width, height, h, col, row, good);

    // The coarsest lattice that interpolates within the bound.
    int step = kFirstStep, levels = 3;
    while (step > 2 && (step >= 2 * width || step >= 2 * height))
        step /= 2;
    // Equal heights: one interval of a metre above them, never used beyond its start.
    const double span = high > low ? high - low : 1.0;
    int nx = 0, ny = 0;
    for (;;) {
        nx = (width - 1 + step - 1) / step + 1, ny = (height - 1 + step - 1) / step + 1;
        nx = std::max(nx, 2), ny = std::max(ny, 2);
        double errorGrid, errorHeight, errorBoth;
        if (!m.Lattice(x0, y0, nx, ny, step, levels, low, span / (levels - 1), errorGrid,
                       errorHeight, errorBoth))
            return m.ExactWindow(x0, y0, width, height, h, col, row, good);
        if (errorGrid <= m.maxError && errorHeight <= m.maxError && errorBoth <= m.maxError)
            break;
        // Refine where the error is; where the combination alone fails, where it is larger.
        const bool finer = errorGrid > m.maxError ||
                          (errorHeight <= m.maxError && errorGrid >= errorHeight);
        const bool moreHeights = errorHeight > m.maxError || !finer;
        if (finer)
            step /= 2;
        if (moreHeights)
            levels = 2 * levels - 1;
        if (step < 2 || levels > kMaxLevels)
            return m.ExactWindow(x0, y0, width, height, h, col, row, good);
    }
    m.lastStep = step, m.lastLevels = levels;

    // Each pixel: its cell and the fractions within it, then linear in height.
    const double dh = span / (levels - 1);
    m.cellOf.resize(static_cast<size_t>(width));
    m.fractionOf.resize(static_cast<size_t>(width));
    for (int i = 0; i < width; ++i) {
        const int cell = std::min(i / step, nx - 2);
        m.cellOf[i] = cell, m.fractionOf[i] = static_cast<double>(i - cell * step) / step;
    }
    const double* nc = m.nodeCol.data();
    const double* nr = m.nodeRow.data();
    const size_t rowStride = static_cast<size_t>(nx) * levels;
    for (int j = 0; j < height; ++j) {
        const int cj = std::min(j / step, ny - 2);
        const double fl = static_cast<double>(j - cj * step) / step;
        const double* c0 = nc + cj * rowStride;
        const double* r0 = nr + cj * rowStride;
        const size_t line = static_cast<size_t>(j) * width;
        for (int i = 0; i < width; ++i) {
            const size_t k = line + i;
            const double hk = h[k];
            if (!std::isfinite(hk)) {
                good[k] = false, col[k] = row[k] = 0;
                continue;
            }
            const double u = (hk - low) / dh;
            const int v = 2 * Piece(u, levels);
            double wv0, wv1, wv2;
            HeightWeights(u - v, wv0, wv1, wv2);
            const double fp = m.fractionOf[i];
            const size_t a = static_cast<size_t>(m.cellOf[i]) * levels + v;
            const size_t b = a + levels, d = a + rowStride, e = d + levels;
            const double w00 = (1 - fp) * (1 - fl), w10 = fp * (1 - fl), w01 = (1 - fp) * fl,
                         w11 = fp * fl;
            double sc = 0, sr = 0;
            const double wv[3] = {wv0, wv1, wv2};
            for (int q = 0; q < 3; ++q) {
                sc += wv[q] * (w00 * c0[a + q] + w10 * c0[b + q] + w01 * c0[d + q] +
                               w11 * c0[e + q]);
                sr += wv[q] * (w00 * r0[a + q] + w10 * r0[b + q] + w01 * r0[d + q] +
                               w11 * r0[e + q]);
            }
            col[k] = sc, row[k] = sr;
            good[k] = true;
        }
    }
}

}  // namespace processes
}  // namespace kestrel
