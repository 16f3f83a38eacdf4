// The frame camera: a pinhole (Brown-Conrady) or fisheye lens at a projection centre, projecting
// in the Cartesian (geocentric) frame of its ground CRS's datum.
#include <algorithm>
#include <cmath>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include <ogr_spatialref.h>

#include <kestrel/exception.h>
#include <kestrel/mathmodel.h>

namespace kestrel {
namespace mathmodel {

namespace {

using Matrix = std::array<double, 9>;
using Vector = std::array<double, 3>;
constexpr double kPi = 3.14159265358979323846;

Matrix Multiply(const Matrix& a, const Matrix& b) {
    Matrix m{};
    for (int r = 0; r < 3; ++r)
        for (int c = 0; c < 3; ++c)
            m[r * 3 + c] = a[r * 3] * b[c] + a[r * 3 + 1] * b[3 + c] + a[r * 3 + 2] * b[6 + c];
    return m;
}

Vector Apply(const Matrix& m, const Vector& v) {
    return {m[0] * v[0] + m[1] * v[1] + m[2] * v[2], m[3] * v[0] + m[4] * v[1] + m[5] * v[2],
            m[6] * v[0] + m[7] * v[1] + m[8] * v[2]};
}

Vector ApplyTransposed(const Matrix& m, const Vector& v) {
    return {m[0] * v[0] + m[3] * v[1] + m[6] * v[2], m[1] * v[0] + m[4] * v[1] + m[7] * v[2],
            m[2] * v[0] + m[5] * v[1] + m[8] * v[2]};
}

// Rows east, north, up of the topocentric frame at a geodetic longitude and latitude (radians),
// in geocentric coordinates.
Matrix EastNorthUp(double lon, double lat) {
    const double sl = std::sin(lon), cl = std::cos(lon), sp = std::sin(lat), cp = std::cos(lat);
    return {-sl, cl, 0, -sp * cl, -sp * sl, cp, cp * cl, cp * sl, sp};
}

// A PROJ transformation between two CRSs, made once in the process and copied from there:
// making one searches PROJ's database (some milliseconds), and a survey's cameras all share
// their CRSs. Copies are taken under the entry's lock.
struct SharedTransformation {
    explicit SharedTransformation(const ogc::cs::ICRS& from, const ogc::cs::ICRS& to)
        : prototype(from, to) {}
    ogc::cs::CoordinateTransformation prototype;
    std::mutex mutex;
};

std::shared_ptr<SharedTransformation> FindTransformation(const ogc::cs::ICRS& from,
                                                         const ogc::cs::ICRS& to) {
    // Never destroyed: PROJ may be gone when the process's statics are.
    static std::mutex& mutex = *new std::mutex;
    static auto& made =
        *new std::map<std::pair<std::string, std::string>, std::shared_ptr<SharedTransformation>>;
    const std::pair<std::string, std::string> key(from.GetWKT(), to.GetWKT());
    std::lock_guard<std::mutex> lock(mutex);
    std::shared_ptr<SharedTransformation>& entry = made[key];
    if (!entry) {
        try {
            entry = std::make_shared<SharedTransformation>(from, to);
        } catch (...) {
            made.erase(key);
            throw;
        }
    }
    return entry;
}

// PROJ transformations of one pair of CRSs, handed out one per calling thread at a time: the
// model's const operations may run on several threads, PROJ's objects may not.
class TransformPool {
  public:
    TransformPool(const ogc::cs::ICRS& from, const ogc::cs::ICRS& to)
        : shared_(FindTransformation(from, to)) {}

    class Lease {
      public:
        Lease(TransformPool& pool, std::unique_ptr<ogc::cs::CoordinateTransformation> t)
            : pool_(pool), transform_(std::move(t)) {}
        ~Lease() {
            std::lock_guard<std::mutex> lock(pool_.mutex_);
            pool_.free_.push_back(std::move(transform_));
        }
        Lease(const Lease&) = delete;
        Lease& operator=(const Lease&) = delete;
        const ogc::cs::CoordinateTransformation* operator->() const { return transform_.get(); }

      private:
        TransformPool& pool_;
        std::unique_ptr<ogc::cs::CoordinateTransformation> transform_;
    };

    Lease Take() {
        {
            std::lock_guard<std::mutex> lock(mutex_);
            if (!free_.empty()) {
                auto t = std::move(free_.back());
                free_.pop_back();
                return Lease(*this, std::move(t));
            }
        }
        std::lock_guard<std::mutex> lock(shared_->mutex);
        return Lease(*this,
                     std::make_unique<ogc::cs::CoordinateTransformation>(shared_->prototype));
    }

  private:
    std::shared_ptr<SharedTransformation> shared_;
    std::mutex mutex_;
    std::vector<std::unique_ptr<ogc::cs::CoordinateTransformation>> free_;
};

// The lens: normalised camera coordinates (x = X/Z, y = Y/Z) to distorted ones and back.
class Lens {
  public:
    explicit Lens(const CameraIntrinsics& c) : c_(c) { limit_ = OneToOneLimit(); }

    // False beyond the field in which the distortion is one-to-one.
    bool Distort(double x, double y, double& xd, double& yd) const {
        const double r2 = x * x + y * y;
        if (c_.lens == LensType::Fisheye) {
            const double r = std::sqrt(r2);
            const double theta = std::atan(r);
            if (theta > limit_)
                return false;
            const double scale = r > 0 ? Theta(theta) / r : 1.0;
            xd = x * scale, yd = y * scale;
            return true;
        }
        if (r2 > limit_ * limit_)
            return false;
        const double radial = 1 + r2 * (c_.k1 + r2 * (c_.k2 + r2 * c_.k3));
        xd = x * radial + 2 * c_.p1 * x * y + c_.p2 * (r2 + 2 * x * x);
        yd = y * radial + c_.p1 * (r2 + 2 * y * y) + 2 * c_.p2 * x * y;
        return true;
    }

    // Newton's method on the distortion, from the distorted position.
    bool Undistort(double xd, double yd, double& x, double& y) const {
        if (c_.lens == LensType::Fisheye) {
            const double thetaD = std::hypot(xd, yd);
            double theta = thetaD;
            for (int i = 0; i < 50; ++i) {
                const double t2 = theta * theta;
                const double slope =
                    1 + t2 * (3 * c_.k1 + t2 * (5 * c_.k2 + t2 * (7 * c_.k3 + t2 * 9 * c_.k4)));
                const double step = (Theta(theta) - thetaD) / slope;
                theta -= step;
                if (std::fabs(step) < 1e-15)
                    break;
            }
            if (!(theta >= 0 && theta <= limit_) || std::fabs(Theta(theta) - thetaD) > 1e-12)
                return false;
            const double scale = thetaD > 0 ? std::tan(theta) / thetaD : 1.0;
            x = xd * scale, y = yd * scale;
            return true;
        }
        x = xd, y = yd;
        for (int i = 0; i < 50; ++i) {
            const double r2 = x * x + y * y;
            const double radial = 1 + r2 * (c_.k1 + r2 * (c_.k2 + r2 * c_.k3));
            const double slope = c_.k1 + r2 * (2 * c_.k2 + r2 * 3 * c_.k3);
            const double fx = x * radial + 2 * c_.p1 * x * y + c_.p2 * (r2 + 2 * x * x) - xd;
            const double fy = y * radial + c_.p1 * (r2 + 2 * y * y) + 2 * c_.p2 * x * y - yd;
            const double a = radial + 2 * x * x * slope + 2 * c_.p1 * y + 6 * c_.p2 * x;
            const double b = 2 * x * y * slope + 2 * c_.p1 * x + 2 * c_.p2 * y;
            const double d = radial + 2 * y * y * slope + 6 * c_.p1 * y + 2 * c_.p2 * x;
            const double det = a * d - b * b;
            if (!(std::fabs(det) > 1e-300))
                return false;
            const double dx = (d * fx - b * fy) / det, dy = (a * fy - b * fx) / det;
            x -= dx, y -= dy;
            if (std::fabs(dx) + std::fabs(dy) < 1e-15)
                break;
        }
        double cx, cy;
        return Distort(x, y, cx, cy) && std::hypot(cx - xd, cy - yd) < 1e-12;
    }

  private:
    double Theta(double theta) const {
        const double t2 = theta * theta;
        return theta * (1 + t2 * (c_.k1 + t2 * (c_.k2 + t2 * (c_.k3 + t2 * c_.k4))));
    }
    double Radial(double r) const {
        const double r2 = r * r;
        return r * (1 + r2 * (c_.k1 + r2 * (c_.k2 + r2 * c_.k3)));
    }

    // The radius (Brown: of x, y; fisheye: the angle) up to which the radial distortion keeps
    // increasing; beyond it points far outside the view would fold back into the image.
    double OneToOneLimit() const {
        const bool fisheye = c_.lens == LensType::Fisheye;
        const double end = fisheye ? kPi / 2 : 20.0;  // 87 degrees from the axis for a pinhole
        auto f = [&](double r) { return fisheye ? Theta(r) : Radial(r); };
        const int steps = 20000;
        double previous = 0.0;
        for (int i = 1; i <= steps; ++i) {
            const double r = end * i / steps;
            if (!(f(r) > previous))
                return end * (i - 1) / steps;
            previous = f(r);
        }
        return end;
    }

    CameraIntrinsics c_;
    double limit_;
};

class FrameCameraModel final : public IMathModel {
  public:
    FrameCameraModel(const CameraIntrinsics& intrinsics, const CameraPose& pose,
                     const std::string& what)
        : intrinsics_(intrinsics), lens_(intrinsics), crs_(pose.crs) {
        const OGRSpatialReference& srs = crs_.GetSpatialReference();
        OGRSpatialReference geocentric;
        geocentric.SetGeocCS("Geocentric");
        if (geocentric.CopyGeogCSFrom(&srs) != OGRERR_NONE) {
            KESTREL_THROW(DataException,
                          FormatString("%s: the CRS \"%s\" has no geodetic datum to place a "
                                       "camera in",
                                       what.c_str(), crs_.GetName().c_str()));
        }
        const ogc::cs::ICRS cartesian(geocentric);
        toCartesian_ = std::make_unique<TransformPool>(crs_, cartesian);
        fromCartesian_ = std::make_unique<TransformPool>(cartesian, crs_);
        semiMajor_ = geocentric.GetSemiMajor();
        const double inverseFlattening = geocentric.GetInvFlattening();
        const double f = inverseFlattening > 0 ? 1.0 / inverseFlattening : 0.0;
        eccentricity2_ = f * (2 - f);
        // Longitude, latitude in degrees and ellipsoidal heights go to the geocentric frame by a
        // closed formula, without PROJ.
        geodetic_ = srs.IsGeographic() && !srs.IsCompound() && srs.GetAxesCount() == 3 &&
                    std::fabs(srs.GetAngularUnits() - kPi / 180) < 1e-15 &&
                    srs.GetPrimeMeridian() == 0.0;

        Matrix frame;  // geocentric to the pose's frame
        if (pose.frame == CameraPose::Frame::LocalGrid) {
            Vector c = pose.centre;
            double grid[3][2] = {{c[0], c[0]}, {c[1], c[1]}, {c[2], c[2]}};
            grid[1][1] += srs.IsGeographic() ? 1e-5 : 1.0;  // one step along grid north
            if (!toCartesian_->Take()->Transform(2, grid[0], grid[1], grid[2])) {
                KESTREL_THROW(DataException,
                              FormatString("%s: PROJ cannot take the camera centre (%.17g, %.17g, "
                                           "%.17g) from \"%s\" to geocentric coordinates",
                                           what.c_str(), c[0], c[1], c[2],
                                           crs_.GetName().c_str()));
            }
            centre_ = {grid[0][0], grid[1][0], grid[2][0]};
            const Matrix enu = LocalFrame(centre_);
            const Vector north = Apply(enu, {grid[0][1] - grid[0][0], grid[1][1] - grid[1][0],
                                             grid[2][1] - grid[2][0]});
            // Grid north turned from true north by the meridian convergence.
            const double a = std::atan2(north[0], north[1]);
            const Matrix toGrid = {std::cos(a), -std::sin(a), 0, std::sin(a), std::cos(a), 0,
                                   0,           0,            1};
            frame = Multiply(toGrid, enu);
            centreHeight_ = c[2];
        } else {
            const ogc::cs::ICRS wgs84("EPSG:4979");
            double o[3] = {pose.origin[0], pose.origin[1], pose.origin[2]};
            if (!TransformPool(wgs84, cartesian).Take()->Transform(1, &o[0], &o[1], &o[2])) {
                KESTREL_THROW(DataException,
                              FormatString("%s: the frame's origin (%.12g, %.12g, %.6g) is not "
                                           "a place on the earth",
                                           what.c_str(), pose.origin[0], pose.origin[1],
                                           pose.origin[2]));
            }
            frame = EastNorthUp(pose.origin[0] * kPi / 180, pose.origin[1] * kPi / 180);
            const Vector offset = ApplyTransposed(frame, pose.centre);
            centre_ = {o[0] + offset[0], o[1] + offset[1], o[2] + offset[2]};
            double h[3] = {centre_[0], centre_[1], centre_[2]};
            fromCartesian_->Take()->Transform(1, &h[0], &h[1], &h[2]);
            centreHeight_ = h[2];
        }
        rotation_ = Multiply(pose.rotation, frame);
        up_ = LocalFrame(centre_);
    }

    const ogc::cs::ICRS* GetCRS() const override { return &crs_; }
    unsigned int GetImageWidth() const override { return intrinsics_.width; }
    unsigned int GetImageHeight() const override { return intrinsics_.height; }

    void GroundToImage(std::size_t n, const double* x, const double* y, const double* z,
                       double* pixel, double* line, bool* ok) const override {
        std::vector<double> gx(x, x + n), gy(y, y + n), gz(z, z + n);
        if (geodetic_) {
            for (std::size_t i = 0; i < n; ++i) {
                const double lon = gx[i] * (kPi / 180), lat = gy[i] * (kPi / 180);
                const double sp = std::sin(lat), cp = std::cos(lat);
                const double nu = semiMajor_ / std::sqrt(1 - eccentricity2_ * sp * sp);
                gx[i] = (nu + gz[i]) * cp * std::cos(lon);
                gy[i] = (nu + gz[i]) * cp * std::sin(lon);
                gz[i] = (nu * (1 - eccentricity2_) + gz[i]) * sp;
            }
        } else {
            toCartesian_->Take()->Transform(n, gx.data(), gy.data(), gz.data());
        }
        for (std::size_t i = 0; i < n; ++i) {
            const Vector p = Apply(rotation_, {gx[i] - centre_[0], gy[i] - centre_[1],
                                               gz[i] - centre_[2]});
            double xd, yd;
            ok[i] = p[2] > 0 && lens_.Distort(p[0] / p[2], p[1] / p[2], xd, yd);
            pixel[i] = ok[i] ? intrinsics_.fx * xd + intrinsics_.cx + 0.5 : NAN;
            line[i] = ok[i] ? intrinsics_.fy * yd + intrinsics_.cy + 0.5 : NAN;
            ok[i] = ok[i] && std::isfinite(pixel[i]) && std::isfinite(line[i]);
        }
    }

    // The ray through each position, followed to where its height in the CRS is z: Newton's
    // method on the distance along the ray, with the height's rate taken at the centre.
    void ImageToGround(std::size_t n, const double* pixel, const double* line, const double* z,
                       double* x, double* y, bool* ok) const override {
        std::vector<Vector> rays(n);
        std::vector<double> t(n, 0.0), rate(n, 0.0);
        for (std::size_t i = 0; i < n; ++i) {
            double u, v;
            ok[i] = std::isfinite(z[i]) &&
                    lens_.Undistort((pixel[i] - 0.5 - intrinsics_.cx) / intrinsics_.fx,
                                    (line[i] - 0.5 - intrinsics_.cy) / intrinsics_.fy, u, v);
            if (!ok[i])
                continue;
            rays[i] = ApplyTransposed(rotation_, {u, v, 1.0});
            rate[i] = up_[6] * rays[i][0] + up_[7] * rays[i][1] + up_[8] * rays[i][2];
            ok[i] = rate[i] < -1e-9;  // the ray goes down
            t[i] = ok[i] ? (z[i] - centreHeight_) / rate[i] : 0.0;
            ok[i] = ok[i] && t[i] > 0;
        }
        std::vector<double> gx(n), gy(n), gh(n);
        std::vector<bool> done(n, false);
        const auto transform = fromCartesian_->Take();
        for (int iteration = 0; iteration < 12; ++iteration) {
            for (std::size_t i = 0; i < n; ++i) {
                const Vector& d = rays[i];
                gx[i] = centre_[0] + t[i] * d[0];
                gy[i] = centre_[1] + t[i] * d[1];
                gh[i] = centre_[2] + t[i] * d[2];
            }
            transform->Transform(n, gx.data(), gy.data(), gh.data());
            bool all = true;
            for (std::size_t i = 0; i < n; ++i) {
                if (!ok[i] || done[i])
                    continue;
                const double miss = z[i] - gh[i];
                if (!std::isfinite(miss)) {
                    ok[i] = false;
                    continue;
                }
                t[i] += miss / rate[i];
                done[i] = std::fabs(miss) < 1e-9 * std::max(1.0, std::fabs(t[i]));
                all = all && done[i];
            }
            if (all)
                break;
        }
        for (std::size_t i = 0; i < n; ++i) {
            ok[i] = ok[i] && done[i] && t[i] > 0;
            x[i] = ok[i] ? gx[i] : NAN;
            y[i] = ok[i] ? gy[i] : NAN;
        }
    }

  private:
    // The east-north-up frame at a geocentric position (its geodetic latitude by iteration).
    Matrix LocalFrame(const Vector& p) const {
        const double lon = std::atan2(p[1], p[0]), s = std::hypot(p[0], p[1]);
        double lat = std::atan2(p[2], s * (1 - eccentricity2_));
        for (int i = 0; i < 10; ++i) {
            const double sp = std::sin(lat);
            const double nu = semiMajor_ / std::sqrt(1 - eccentricity2_ * sp * sp);
            lat = std::atan2(p[2] + eccentricity2_ * nu * sp, s);
        }
        return EastNorthUp(lon, lat);
    }

    CameraIntrinsics intrinsics_;
    Lens lens_;
    ogc::cs::ICRS crs_;
    std::unique_ptr<TransformPool> toCartesian_, fromCartesian_;
    double semiMajor_ = 0, eccentricity2_ = 0;
    bool geodetic_ = false;
    Vector centre_{};      // geocentric
    Matrix rotation_{};    // geocentric to camera
    Matrix up_{};          // the east-north-up frame at the centre
    double centreHeight_ = 0;  // in the CRS
};

void CheckFinite(const std::string& what, const char* name, double value) {
    if (!std::isfinite(value)) {
        KESTREL_THROW(DataException, FormatString("%s: the camera's %s is not a finite number",
                                                  what.c_str(), name));
    }
}

}  // namespace

std::unique_ptr<IMathModel> MakeFrameCameraModel(const CameraIntrinsics& intrinsics,
                                                 const CameraPose& pose, const std::string& what) {
    const CameraIntrinsics& c = intrinsics;
    const std::pair<const char*, double> values[] = {
        {"fx", c.fx}, {"fy", c.fy}, {"cx", c.cx}, {"cy", c.cy}, {"k1", c.k1}, {"k2", c.k2},
        {"k3", c.k3}, {"k4", c.k4}, {"p1", c.p1}, {"p2", c.p2}};
    for (const auto& v : values)
        CheckFinite(what, v.first, v.second);
    for (int i = 0; i < 3; ++i) {
        CheckFinite(what, "centre", pose.centre[i]);
        CheckFinite(what, "frame origin", pose.origin[i]);
    }
    for (double r : pose.rotation)
        CheckFinite(what, "rotation", r);
    if (c.width == 0 || c.height == 0 || !(c.fx > 0) || !(c.fy > 0)) {
        KESTREL_THROW(DataException,
                      FormatString("%s: the camera needs an image size and positive focal "
                                   "lengths (width %u, height %u, fx %g, fy %g)",
                                   what.c_str(), c.width, c.height, c.fx, c.fy));
    }
    // R must be a rotation: orthonormal rows, determinant 1.
    const Matrix& r = pose.rotation;
    double worst = 0.0;
    for (int a = 0; a < 3; ++a)
        for (int b = 0; b < 3; ++b) {
            const double dot = r[a * 3] * r[b * 3] + r[a * 3 + 1] * r[b * 3 + 1] +
                               r[a * 3 + 2] * r[b * 3 + 2];
            worst = std::max(worst, std::fabs(dot - (a == b ? 1.0 : 0.0)));
        }
    const double det = r[0] * (r[4] * r[8] - r[5] * r[7]) - r[1] * (r[3] * r[8] - r[5] * r[6]) +
                       r[2] * (r[3] * r[7] - r[4] * r[6]);
    if (worst > 1e-6 || det < 0) {
        KESTREL_THROW(DataException,
                      FormatString("%s: the camera's rotation is not a rotation matrix (rows "
                                   "off orthonormal by %.3g, determinant %.6g)",
                                   what.c_str(), worst, det));
    }
    return std::make_unique<FrameCameraModel>(intrinsics, pose, what);
}

std::array<double, 9> RotationFromOpk(double omega, double phi, double kappa) {
    const double w = omega * kPi / 180, p = phi * kPi / 180, k = kappa * kPi / 180;
    const Matrix r1 = {1, 0, 0, 0, std::cos(w), std::sin(w), 0, -std::sin(w), std::cos(w)};
    const Matrix r2 = {std::cos(p), 0, -std::sin(p), 0, 1, 0, std::sin(p), 0, std::cos(p)};
    const Matrix r3 = {std::cos(k), std::sin(k), 0, -std::sin(k), std::cos(k), 0, 0, 0, 1};
    const Matrix flip = {1, 0, 0, 0, -1, 0, 0, 0, -1};
    return Multiply(flip, Multiply(r3, Multiply(r2, r1)));
}

std::array<double, 3> OpkFromRotation(const std::array<double, 9>& r) {
    // M = diag(1, -1, -1) R: M[2][0] = sin phi, M[2][1] = -cos phi sin omega,
    // M[2][2] = cos phi cos omega, M[1][0] = -sin kappa cos phi, M[0][0] = cos kappa cos phi.
    const double m00 = r[0], m10 = -r[3], m20 = -r[6], m21 = -r[7], m22 = -r[8];
    const double phi = std::asin(std::clamp(m20, -1.0, 1.0));
    return {std::atan2(-m21, m22) * 180 / kPi, phi * 180 / kPi, std::atan2(-m10, m00) * 180 / kPi};
}

std::array<double, 9> RotationFromAxisAngle(const std::array<double, 3>& v) {
    const double angle = std::sqrt(v[0] * v[0] + v[1] * v[1] + v[2] * v[2]);
    if (angle < 1e-300)
        return {1, 0, 0, 0, 1, 0, 0, 0, 1};
    const double x = v[0] / angle, y = v[1] / angle, z = v[2] / angle;
    const double c = std::cos(angle), s = std::sin(angle), t = 1 - c;
    return {t * x * x + c,     t * x * y - s * z, t * x * z + s * y,
            t * x * y + s * z, t * y * y + c,     t * y * z - s * x,
            t * x * z - s * y, t * y * z + s * x, t * z * z + c};
}

}  // namespace mathmodel
}  // namespace kestrel
