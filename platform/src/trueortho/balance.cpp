// Colour balancing: per channel, robust least squares (Huber's loss by iteratively reweighted
// least squares) over the equations gain_a * a + offset_a = gain_b * b + offset_b of every
// sample of every overlap, group by group of scenes that overlaps join.
#include "balance.h"

#include <kestrel/exception.h>

#include <algorithm>
#include <array>
#include <cmath>
#include <cstdint>
#include <numeric>
#include <string>

namespace kestrel {
namespace processes {
namespace trueortho {

namespace {

// Scenes joined by overlaps (indices into the job's scenes), and those overlaps with the
// scenes' indices within the group.
struct Group {
    std::vector<std::size_t> scenes;
    struct Edge {
        std::size_t a, b;
        const OverlapSamples* samples;
    };
    std::vector<Edge> edges;
};

// Calls f(a, b) for each sample of `overlap` whose two values in channel c are finite.
template <class F>
void ForEachSample(const OverlapSamples& overlap, int c, int bands, F f) {
    for (std::size_t i = c; i < overlap.valuesA.size(); i += bands) {
        const double a = overlap.valuesA[i], b = overlap.valuesB[i];
        if (std::isfinite(a) && std::isfinite(b))
            f(a, b);
    }
}

bool HasSample(const OverlapSamples& overlap, int c, int bands) {
    for (std::size_t i = c; i < overlap.valuesA.size(); i += bands)
        if (std::isfinite(overlap.valuesA[i]) && std::isfinite(overlap.valuesB[i]))
            return true;
    return false;
}

std::vector<Group> GroupsOf(std::size_t scenes, const std::vector<OverlapSamples>& overlaps, int c,
                            int bands) {
    std::vector<std::size_t> parent(scenes);
    std::iota(parent.begin(), parent.end(), std::size_t{0});
    auto root = [&](std::size_t s) {
        while (parent[s] != s)
            s = parent[s] = parent[parent[s]];
        return s;
    };
    std::vector<const OverlapSamples*> used;
    for (const OverlapSamples& overlap : overlaps)
        if (overlap.a != overlap.b && HasSample(overlap, c, bands)) {
            parent[root(overlap.a)] = root(overlap.b);
            used.push_back(&overlap);
        }
    std::vector<Group> groups;
    std::vector<std::size_t> groupOf(scenes, SIZE_MAX), local(scenes, SIZE_MAX);
    auto place = [&](std::size_t s) {
        std::size_t& g = groupOf[root(s)];
        if (g == SIZE_MAX)
            g = groups.size(), groups.emplace_back();
        if (local[s] == SIZE_MAX)
            local[s] = groups[g].scenes.size(), groups[g].scenes.push_back(s);
        return g;
    };
    for (const OverlapSamples* overlap : used) {
        place(overlap->a);
        groups[place(overlap->b)].edges.push_back({local[overlap->a], local[overlap->b], overlap});
    }
    return groups;
}

// The normal equations of a group: a block of u x u per scene and per overlap (u = 1: gains;
// 2: gains and offsets, the gain first), the prior's right-hand side.
struct NormalEquations {
    using Block = std::array<double, 4>;  // row-major 2 x 2; u = 1 uses the first entry
    std::size_t n;
    int u;
    std::vector<Block> diag, edge;
    std::vector<double> rhs;

    std::size_t Size() const { return n * u; }
    void Multiply(const Group& group, const std::vector<double>& x, std::vector<double>& y) const {
        y.assign(Size(), 0.0);
        for (std::size_t i = 0; i < n; ++i)
            for (int r = 0; r < u; ++r)
                for (int c = 0; c < u; ++c)
                    y[i * u + r] += diag[i][r * 2 + c] * x[i * u + c];
        for (std::size_t e = 0; e < edge.size(); ++e) {
            const std::size_t a = group.edges[e].a, b = group.edges[e].b;
            for (int r = 0; r < u; ++r)
                for (int c = 0; c < u; ++c) {
                    y[a * u + r] += edge[e][r * 2 + c] * x[b * u + c];
                    y[b * u + c] += edge[e][r * 2 + c] * x[a * u + r];
                }
        }
    }
};

// Cholesky's solution of the equations written out densely; false when they are not
// positive definite.
bool SolveDense(const Group& group, const NormalEquations& eq, std::vector<double>& x) {
    const std::size_t size = eq.Size();
    const int u = eq.u;
    std::vector<double> m(size * size, 0.0);
    auto at = [&](std::size_t r, std::size_t c) -> double& { return m[r * size + c]; };
    for (std::size_t i = 0; i < eq.n; ++i)
        for (int r = 0; r < u; ++r)
            for (int c = 0; c < u; ++c)
                at(i * u + r, i * u + c) += eq.diag[i][r * 2 + c];
    for (std::size_t e = 0; e < eq.edge.size(); ++e)
        for (int r = 0; r < u; ++r)
            for (int c = 0; c < u; ++c) {
                const std::size_t row = group.edges[e].a * u + r, col = group.edges[e].b * u + c;
                at(row, col) += eq.edge[e][r * 2 + c];
                at(col, row) += eq.edge[e][r * 2 + c];
            }
    for (std::size_t j = 0; j < size; ++j) {  // lower triangle: L with L L^T = m
        double d = at(j, j);
        for (std::size_t k = 0; k < j; ++k)
            d -= at(j, k) * at(j, k);
        if (!(d > 0.0) || !std::isfinite(d))
            return false;
        at(j, j) = std::sqrt(d);
        for (std::size_t i = j + 1; i < size; ++i) {
            double s = at(i, j);
            for (std::size_t k = 0; k < j; ++k)
                s -= at(i, k) * at(j, k);
            at(i, j) = s / at(j, j);
        }
    }
    x = eq.rhs;
    for (std::size_t i = 0; i < size; ++i) {
        for (std::size_t k = 0; k < i; ++k)
            x[i] -= at(i, k) * x[k];
        x[i] /= at(i, i);
    }
    for (std::size_t i = size; i-- > 0;) {
        for (std::size_t k = i + 1; k < size; ++k)
            x[i] -= at(k, i) * x[k];
        x[i] /= at(i, i);
    }
    return true;
}

// Conjugate gradients from x, preconditioned by the inverse of each scene's block: memory and
// time per step grow with the overlaps, not with their square.
bool SolveIterative(const Group& group, const NormalEquations& eq, std::vector<double>& x) {
    const std::size_t size = eq.Size();
    const int u = eq.u;
    std::vector<NormalEquations::Block> inverse(eq.n);
    for (std::size_t i = 0; i < eq.n; ++i) {
        const auto& d = eq.diag[i];
        if (u == 1) {
            inverse[i][0] = 1.0 / d[0];
            continue;
        }
        const double det = d[0] * d[3] - d[1] * d[2];
        inverse[i] = {d[3] / det, -d[1] / det, -d[2] / det, d[0] / det};
    }
    auto precondition = [&](const std::vector<double>& r, std::vector<double>& z) {
        z.assign(size, 0.0);
        for (std::size_t i = 0; i < eq.n; ++i)
            for (int a = 0; a < u; ++a)
                for (int b = 0; b < u; ++b)
                    z[i * u + a] += inverse[i][a * 2 + b] * r[i * u + b];
    };
    auto dot = [](const std::vector<double>& a, const std::vector<double>& b) {
        return std::inner_product(a.begin(), a.end(), b.begin(), 0.0);
    };
    std::vector<double> r(size), z, p, q;
    eq.Multiply(group, x, q);
    for (std::size_t i = 0; i < size; ++i)
        r[i] = eq.rhs[i] - q[i];
    precondition(r, z);
    p = z;
    double rz = dot(r, z);
    const double goal = 1e-20 * dot(eq.rhs, eq.rhs);
    const std::size_t steps = std::max<std::size_t>(200, 20 * size);
    for (std::size_t step = 0; step < steps && dot(r, r) > goal; ++step) {
        eq.Multiply(group, p, q);
        const double pq = dot(p, q);
        if (!(pq > 0.0))
            return false;
        const double alpha = rz / pq;
        for (std::size_t i = 0; i < size; ++i)
            x[i] += alpha * p[i], r[i] -= alpha * q[i];
        precondition(r, z);
        const double next = dot(r, z);
        for (std::size_t i = 0; i < size; ++i)
            p[i] = z[i] + next / rz * p[i];
        rz = next;
    }
    for (double v : x)
        if (!std::isfinite(v))
            return false;
    return true;
}

// Fits one group in channel c into `fit`; leaves the identity there when the fit is not sane.
void FitGroup(const Group& group, int c, int bands, BalanceMode mode, const BalanceParams& params,
              BalanceFit& fit) {
    const std::size_t n = group.scenes.size();
    const int u = mode == BalanceMode::Gain ? 1 : 2;
    std::vector<double> count(n, 0.0), sum(n, 0.0);
    double squares = 0.0;
    for (const Group::Edge& e : group.edges)
        ForEachSample(*e.samples, c, bands, [&](double a, double b) {
            count[e.a] += 1, count[e.b] += 1, sum[e.a] += a, sum[e.b] += b;
            squares += a * a + b * b;
        });
    const double total = std::accumulate(count.begin(), count.end(), 0.0);
    const double raw = std::accumulate(sum.begin(), sum.end(), 0.0);
    // The spread of the group's values: the prior's pseudo-samples lie this far either side of
    // each scene's mean, and a change of gain counts as the change it makes there.
    const double spread =
        std::max(1.0, std::sqrt(std::max(0.0, squares / total - (raw / total) * (raw / total))));

    std::vector<double> x(n * u, 0.0);
    for (std::size_t i = 0; i < n; ++i)
        x[i * u] = 1.0;
    auto gain = [&](const std::vector<double>& v, std::size_t i) { return v[i * u]; };
    auto offset = [&](const std::vector<double>& v, std::size_t i) {
        return u == 2 ? v[i * u + 1] : 0.0;
    };
    // A common scale of every gain and offset and a common shift of the offsets change no
    // residual. Fixed after every step, so that the robust weights see residuals in grey levels
    // (shrinking every gain would shrink every residual): the group's samples keep their mean
    // and, with offsets, their mean gain is 1.
    auto anchor = [&](std::vector<double>& v) {
        double gains = 0.0, corrected = 0.0;
        for (std::size_t i = 0; i < n; ++i) {
            gains += count[i] * gain(v, i);
            corrected += gain(v, i) * sum[i] + offset(v, i) * count[i];
        }
        double scale = 1.0, shift = 0.0;
        if (u == 2) {
            scale = total / gains;
            shift = (raw - scale * corrected) / total;
        } else if (std::abs(corrected) > 1e-12 * (std::abs(raw) + 1.0)) {
            scale = raw / corrected;
        }
        for (std::size_t i = 0; i < n; ++i) {
            v[i * u] *= scale;
            if (u == 2)
                v[i * u + 1] = scale * v[i * u + 1] + shift;
        }
    };
    for (int iteration = 0; iteration < params.iterations; ++iteration) {
        NormalEquations eq{n, u, std::vector<NormalEquations::Block>(n, {0, 0, 0, 0}),
                           std::vector<NormalEquations::Block>(group.edges.size(), {0, 0, 0, 0}),
                           std::vector<double>(n * u, 0.0)};
        for (std::size_t k = 0; k < group.edges.size(); ++k) {
            const Group::Edge& e = group.edges[k];
            const double ga = gain(x, e.a), oa = offset(x, e.a);
            const double gb = gain(x, e.b), ob = offset(x, e.b);
            double aa = 0, sa = 0, bb = 0, sb = 0, ab = 0, w = 0;
            ForEachSample(*e.samples, c, bands, [&](double a, double b) {
                const double residual = std::abs(ga * a + oa - gb * b - ob);
                const double weight =
                    residual <= params.huberThreshold ? 1.0 : params.huberThreshold / residual;
                aa += weight * a * a, sa += weight * a, bb += weight * b * b, sb += weight * b;
                ab += weight * a * b, w += weight;
            });
            // Residual gain_a a + offset_a - gain_b b - offset_b: derivatives (a, 1, -b, -1).
            auto& da = eq.diag[e.a];
            auto& db = eq.diag[e.b];
            da[0] += aa, da[1] += sa, da[2] += sa, da[3] += w;
            db[0] += bb, db[1] += sb, db[2] += sb, db[3] += w;
            eq.edge[k] = {-ab, -sa, -sb, -w};
        }
        // The prior: pseudo-samples at the scene's mean +- the spread that the correction
        // should leave as they are, so that it pulls on the scene's mean and contrast alike.
        for (std::size_t i = 0; i < n; ++i) {
            const double weight = (params.priorShare * count[i] + params.priorSamples) / 2;
            for (const double v : {sum[i] / count[i] - spread, sum[i] / count[i] + spread}) {
                auto& d = eq.diag[i];
                d[0] += weight * v * v, d[1] += weight * v, d[2] += weight * v, d[3] += weight;
                eq.rhs[i * u] += weight * v * v;
                if (u == 2)
                    eq.rhs[i * u + 1] += weight * v;
            }
        }
        std::vector<double> next = x;
        const bool solved =
            n <= params.denseLimit ? SolveDense(group, eq, next) : SolveIterative(group, eq, next);
        if (!solved)
            return;
        anchor(next);
        double change = 0.0;
        for (std::size_t i = 0; i < n; ++i)
            change = std::max(change, spread * std::abs(gain(next, i) - gain(x, i)) +
                                          std::abs(offset(next, i) - offset(x, i)));
        x.swap(next);
        if (change < 1e-4)
            break;
    }

    for (std::size_t i = 0; i < n; ++i) {
        if (!(gain(x, i) > 0.0) || !std::isfinite(gain(x, i)) || !std::isfinite(offset(x, i)))
            return;  // an inverted or unbounded scene is no balance: keep the identity
    }
    for (std::size_t i = 0; i < n; ++i) {
        fit.gain[group.scenes[i]][c] = gain(x, i);
        fit.offset[group.scenes[i]][c] = offset(x, i);
    }
}

}  // namespace

BalanceFit FitBalance(std::size_t scenes, int bands, const std::vector<OverlapSamples>& overlaps,
                      BalanceMode mode, const BalanceParams& params) {
    if (bands < 1)
        KESTREL_THROW(DataException, "colour balance: " + std::to_string(bands) + " channels");
    for (std::size_t k = 0; k < overlaps.size(); ++k) {
        const OverlapSamples& o = overlaps[k];
        if (o.a >= scenes || o.b >= scenes || o.valuesA.size() != o.valuesB.size() ||
            o.valuesA.size() % bands != 0)
            KESTREL_THROW(DataException,
                          "colour balance: overlap " + std::to_string(k) + " of scenes " +
                              std::to_string(o.a) + " and " + std::to_string(o.b) + " (of " +
                              std::to_string(scenes) + ") has " + std::to_string(o.valuesA.size()) +
                              " and " + std::to_string(o.valuesB.size()) + " values for " +
                              std::to_string(bands) + " channels");
    }
    BalanceFit fit;
    fit.gain.assign(scenes, std::vector<double>(bands, 1.0));
    fit.offset.assign(scenes, std::vector<double>(bands, 0.0));
    if (mode == BalanceMode::None)
        return fit;
    for (int c = 0; c < bands; ++c)
        for (const Group& group : GroupsOf(scenes, overlaps, c, bands))
            FitGroup(group, c, bands, mode, params, fit);
    return fit;
}

}  // namespace trueortho
}  // namespace processes
}  // namespace kestrel
