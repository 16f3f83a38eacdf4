#include <algorithm>
#include <cmath>
#include <memory>

#include <gdal.h>

#include <kestrel/exception.h>

#include "models.h"

namespace kestrel {
namespace mathmodel {

namespace {

constexpr int kTerms = 20;

// The RPC00B terms of normalised longitude L, latitude P and height H.
inline void Terms(double L, double P, double H, double t[kTerms]) {
    t[0] = 1.0;
    t[1] = L;
    t[2] = P;
    t[3] = H;
    t[4] = L * P;
    t[5] = L * H;
    t[6] = P * H;
    t[7] = L * L;
    t[8] = P * P;
    t[9] = H * H;
    t[10] = P * L * H;
    t[11] = L * L * L;
    t[12] = L * P * P;
    t[13] = L * H * H;
    t[14] = L * L * P;
    t[15] = P * P * P;
    t[16] = P * H * H;
    t[17] = L * L * H;
    t[18] = P * P * H;
    t[19] = H * H * H;
}

// Their derivatives by L and by P.
inline void TermsDerivatives(double L, double P, double H, double dL[kTerms], double dP[kTerms]) {
    dL[0] = 0.0, dP[0] = 0.0;
    dL[1] = 1.0, dP[1] = 0.0;
    dL[2] = 0.0, dP[2] = 1.0;
    dL[3] = 0.0, dP[3] = 0.0;
    dL[4] = P, dP[4] = L;
    dL[5] = H, dP[5] = 0.0;
    dL[6] = 0.0, dP[6] = H;
    dL[7] = 2 * L, dP[7] = 0.0;
    dL[8] = 0.0, dP[8] = 2 * P;
    dL[9] = 0.0, dP[9] = 0.0;
    dL[10] = P * H, dP[10] = L * H;
    dL[11] = 3 * L * L, dP[11] = 0.0;
    dL[12] = P * P, dP[12] = 2 * L * P;
    dL[13] = H * H, dP[13] = 0.0;
    dL[14] = 2 * L * P, dP[14] = L * L;
    dL[15] = 0.0, dP[15] = 3 * P * P;
    dL[16] = 0.0, dP[16] = H * H;
    dL[17] = 2 * L * H, dP[17] = 0.0;
    dL[18] = 0.0, dP[18] = 2 * P * H;
    dL[19] = 0.0, dP[19] = 0.0;
}

inline double Dot(const double a[kTerms], const double b[kTerms]) {
    double sum = 0.0;
    for (int i = 0; i < kTerms; ++i)
        sum += a[i] * b[i];
    return sum;
}

class RpcModel final : public IMathModel {
  public:
    RpcModel(const GDALRPCInfoV2& rpc, unsigned int width, unsigned int height)
        : rpc_(rpc), crs_("EPSG:4979"), width_(width), height_(height) {}

    const ogc::cs::ICRS* GetCRS() const override { return &crs_; }
    unsigned int GetImageWidth() const override { return width_; }
    unsigned int GetImageHeight() const override { return height_; }

    void GroundToImage(std::size_t n, const double* x, const double* y, const double* z,
                       double* pixel, double* line, bool* ok) const override {
        for (std::size_t i = 0; i < n; ++i) {
            double t[kTerms];
            Terms((x[i] - rpc_.dfLONG_OFF) / rpc_.dfLONG_SCALE,
                  (y[i] - rpc_.dfLAT_OFF) / rpc_.dfLAT_SCALE,
                  (z[i] - rpc_.dfHEIGHT_OFF) / rpc_.dfHEIGHT_SCALE, t);
            const double sampleDen = Dot(rpc_.adfSAMP_DEN_COEFF, t);
            const double lineDen = Dot(rpc_.adfLINE_DEN_COEFF, t);
            // RPC samples and lines address pixel centres.
            pixel[i] = Dot(rpc_.adfSAMP_NUM_COEFF, t) / sampleDen * rpc_.dfSAMP_SCALE +
                       rpc_.dfSAMP_OFF + 0.5;
            line[i] = Dot(rpc_.adfLINE_NUM_COEFF, t) / lineDen * rpc_.dfLINE_SCALE +
                      rpc_.dfLINE_OFF + 0.5;
            ok[i] = std::isfinite(pixel[i]) && std::isfinite(line[i]);
        }
    }

    void ImageToGround(std::size_t n, const double* pixel, const double* line, const double* z,
                       double* x, double* y, bool* ok) const override {
        for (std::size_t i = 0; i < n; ++i) {
            double L = 0.0, P = 0.0;
            ok[i] = Solve((pixel[i] - 0.5 - rpc_.dfSAMP_OFF) / rpc_.dfSAMP_SCALE,
                          (line[i] - 0.5 - rpc_.dfLINE_OFF) / rpc_.dfLINE_SCALE,
                          (z[i] - rpc_.dfHEIGHT_OFF) / rpc_.dfHEIGHT_SCALE, L, P);
            x[i] = ok[i] ? L * rpc_.dfLONG_SCALE + rpc_.dfLONG_OFF : NAN;
            y[i] = ok[i] ? P * rpc_.dfLAT_SCALE + rpc_.dfLAT_OFF : NAN;
        }
    }

  private:
    // Normalised sample and line of normalised ground (L, P, H), with their derivatives.
    void Evaluate(double L, double P, double H, double& s, double& l, double jacobian[4]) const {
        double t[kTerms], dL[kTerms], dP[kTerms];
        Terms(L, P, H, t);
        TermsDerivatives(L, P, H, dL, dP);
        const double sn = Dot(rpc_.adfSAMP_NUM_COEFF, t), sd = Dot(rpc_.adfSAMP_DEN_COEFF, t);
        const double ln = Dot(rpc_.adfLINE_NUM_COEFF, t), ld = Dot(rpc_.adfLINE_DEN_COEFF, t);
        s = sn / sd;
        l = ln / ld;
        jacobian[0] = (Dot(rpc_.adfSAMP_NUM_COEFF, dL) - s * Dot(rpc_.adfSAMP_DEN_COEFF, dL)) / sd;
        jacobian[1] = (Dot(rpc_.adfSAMP_NUM_COEFF, dP) - s * Dot(rpc_.adfSAMP_DEN_COEFF, dP)) / sd;
        jacobian[2] = (Dot(rpc_.adfLINE_NUM_COEFF, dL) - l * Dot(rpc_.adfLINE_DEN_COEFF, dL)) / ld;
        jacobian[3] = (Dot(rpc_.adfLINE_NUM_COEFF, dP) - l * Dot(rpc_.adfLINE_DEN_COEFF, dP)) / ld;
    }

    // Newton's method on the normalised ground position whose image is (s, l) at height H:
    // converged at a millionth of a pixel, accepted within a thousandth.
    bool Solve(double s, double l, double H, double& L, double& P) const {
        if (!std::isfinite(s) || !std::isfinite(l) || !std::isfinite(H))
            return false;
        const double pixel =
            1.0 / std::max(std::fabs(rpc_.dfSAMP_SCALE), std::fabs(rpc_.dfLINE_SCALE));
        // Start from the polynomials' linear terms, which hold nearly all of a sensor's geometry.
        {
            const double* sn = rpc_.adfSAMP_NUM_COEFF;
            const double* ln = rpc_.adfLINE_NUM_COEFF;
            const double a = sn[1], b = sn[2], c = ln[1], d = ln[2];
            const double rs = s - sn[0] - sn[3] * H, rl = l - ln[0] - ln[3] * H;
            const double det = a * d - b * c;
            L = P = 0.0;
            if (det != 0.0 && std::isfinite(det)) {
                L = std::clamp((d * rs - b * rl) / det, -2.0, 2.0);
                P = std::clamp((a * rl - c * rs) / det, -2.0, 2.0);
            }
        }
        double residual = HUGE_VAL;
        for (int iteration = 0; iteration < 30; ++iteration) {
            double sNow, lNow, j[4];
            Evaluate(L, P, H, sNow, lNow, j);
            const double ds = s - sNow, dl = l - lNow;
            if (!std::isfinite(ds) || !std::isfinite(dl))
                return false;
            residual = std::max(std::fabs(ds), std::fabs(dl));
            if (residual < 1e-6 * pixel)
                return true;
            const double det = j[0] * j[3] - j[1] * j[2];
            if (det == 0.0 || !std::isfinite(det))
                return false;
            double stepL = (j[3] * ds - j[1] * dl) / det;
            double stepP = (j[0] * dl - j[2] * ds) / det;
            // Far outside the polynomials' domain Newton can leap; keep steps within it.
            const double largest = std::max(std::fabs(stepL), std::fabs(stepP));
            if (largest > 0.5) {
                stepL *= 0.5 / largest;
                stepP *= 0.5 / largest;
            }
            L += stepL;
            P += stepP;
        }
        return residual < 1e-3 * pixel;
    }

    GDALRPCInfoV2 rpc_;
    ogc::cs::ICRS crs_;
    unsigned int width_;
    unsigned int height_;
};

}  // namespace

std::unique_ptr<IMathModel> MakeRpcModel(const GDALRPCInfoV2& rpc, unsigned int width,
                                         unsigned int height, const std::string& path) {
    const double scales[] = {rpc.dfLINE_SCALE, rpc.dfSAMP_SCALE, rpc.dfLAT_SCALE, rpc.dfLONG_SCALE,
                             rpc.dfHEIGHT_SCALE};
    const double offsets[] = {rpc.dfLINE_OFF, rpc.dfSAMP_OFF, rpc.dfLAT_OFF, rpc.dfLONG_OFF,
                              rpc.dfHEIGHT_OFF};
    for (int i = 0; i < 5; ++i) {
        if (!std::isfinite(scales[i]) || scales[i] == 0.0 || !std::isfinite(offsets[i])) {
            KESTREL_THROW(DataException,
                          FormatString("The RPC coefficients of \"%s\" hold a zero or non-finite "
                                       "scale or offset",
                                       path.c_str()));
        }
    }
    const double* coefficients[] = {rpc.adfLINE_NUM_COEFF, rpc.adfLINE_DEN_COEFF,
                                    rpc.adfSAMP_NUM_COEFF, rpc.adfSAMP_DEN_COEFF};
    for (const double* c : coefficients) {
        for (int i = 0; i < kTerms; ++i) {
            if (!std::isfinite(c[i])) {
                KESTREL_THROW(DataException,
                              FormatString("The RPC coefficients of \"%s\" hold a non-finite "
                                           "value",
                                           path.c_str()));
            }
        }
    }
    return std::make_unique<RpcModel>(rpc, width, height);
}

}  // namespace mathmodel
}  // namespace kestrel
