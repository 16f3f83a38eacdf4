// Frame cameras: projections against OpenCV, image to ground and back, the photogrammetric
// angles, and the files cameras come from.
#include <gtest/gtest.h>

#include <array>
#include <cmath>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <memory>
#include <random>
#include <sstream>
#include <string>
#include <vector>

#include <gdal_priv.h>

#include <kestrel/exception.h>
#include <kestrel/mathmodel.h>
#include <kestrel/orthoutils.h>
#include <kestrel/trueortho.h>
#include <samplecity.h>

#include "rasterread.h"
#include "support.h"

using kestrel::mathmodel::CameraIntrinsics;
using kestrel::mathmodel::CameraPose;
using kestrel::mathmodel::IMathModel;
using kestrel::mathmodel::LensType;
using testsupport::TempDir;

namespace {

constexpr double kA = 6378137.0;  // WGS 84 semi-major axis

// A Python that has OpenCV, or empty.
std::string PythonWithOpenCv() {
    for (const char* python : {"/usr/bin/python3", "python3"}) {
        const std::string command =
            std::string(python) + " -c \"import cv2, numpy\"" +
#ifdef _WIN32
            " >NUL 2>NUL";
#else
            " >/dev/null 2>&1";
#endif
        if (std::system(command.c_str()) == 0)
            return python;
    }
    return "";
}

// OpenCV's projection of camera-frame points (rotation vector 0, translation 0), in OpenCV's
// pixels.
std::vector<std::array<double, 2>> OpenCvProject(const std::string& python, const TempDir& dir,
                                                 const CameraIntrinsics& c,
                                                 const std::vector<std::array<double, 3>>& p) {
    std::ostringstream in;
    in.precision(17);
    in << (c.lens == LensType::Fisheye ? "fisheye" : "brown") << "\n"
       << c.fx << ' ' << c.fy << ' ' << c.cx << ' ' << c.cy << "\n"
       << c.k1 << ' ' << c.k2 << ' ' << c.k3 << ' ' << c.k4 << ' ' << c.p1 << ' ' << c.p2 << "\n";
    for (const auto& q : p)
        in << q[0] << ' ' << q[1] << ' ' << q[2] << "\n";
    testsupport::WriteFile(dir.File("points.txt"), in.str());
    testsupport::WriteFile(dir.File("project.py"), R"(import sys, cv2, numpy as np
lines = open(sys.argv[1]).read().split("\n")
lens = lines[0]
fx, fy, cx, cy = map(float, lines[1].split())
k1, k2, k3, k4, p1, p2 = map(float, lines[2].split())
pts = np.array([list(map(float, l.split())) for l in lines[3:] if l.strip()]).reshape(-1, 1, 3)
K = np.array([[fx, 0, cx], [0, fy, cy], [0, 0, 1]])
r = np.zeros(3); t = np.zeros(3)
if lens == "fisheye":
    uv, _ = cv2.fisheye.projectPoints(pts, r, t, K, np.array([k1, k2, k3, k4]))
else:
    uv, _ = cv2.projectPoints(pts, r, t, K, np.array([k1, k2, p1, p2, k3]))
for u, v in uv.reshape(-1, 2):
    print("%.17g %.17g" % (u, v))
)");
    const std::string command = python + " \"" + dir.File("project.py") + "\" \"" +
                                dir.File("points.txt") + "\" > \"" + dir.File("uv.txt") + "\"";
    EXPECT_EQ(std::system(command.c_str()), 0);
    std::istringstream out(testsupport::ReadFile(dir.File("uv.txt")));
    std::vector<std::array<double, 2>> uv;
    for (double u, v; out >> u >> v;)
        uv.push_back({u, v});
    return uv;
}

CameraIntrinsics Brown() {
    CameraIntrinsics c;
    c.width = 4000, c.height = 3000;
    c.fx = 3200.5, c.fy = 3190.25, c.cx = 2010.3, c.cy = 1490.7;
    c.k1 = -0.12, c.k2 = 0.08, c.k3 = -0.02, c.p1 = 0.0012, c.p2 = -0.0007;
    return c;
}

CameraIntrinsics Fisheye() {
    CameraIntrinsics c;
    c.lens = LensType::Fisheye;
    c.width = 2000, c.height = 1500;
    c.fx = 700.0, c.fy = 702.0, c.cx = 1001.0, c.cy = 748.0;
    c.k1 = 0.05, c.k2 = -0.01, c.k3 = 0.003, c.k4 = -0.0005;
    return c;
}

// A camera whose frame is east-north-up at longitude 0, latitude 0 on the ellipsoid, with ground
// in geocentric coordinates: there ECEF = (a + up, east, north), so camera-frame points are
// known exactly.
CameraPose EquatorPose(const std::array<double, 3>& axisAngle) {
    CameraPose pose;
    pose.crs = "EPSG:4978";
    pose.frame = CameraPose::Frame::Topocentric;
    pose.origin = {0, 0, 0};
    pose.centre = {30, -20, 500};
    pose.rotation = kestrel::mathmodel::RotationFromAxisAngle(axisAngle);
    return pose;
}

std::array<double, 3> ToEcef(const CameraPose& pose, const std::array<double, 3>& camera) {
    const auto& r = pose.rotation;
    std::array<double, 3> enu;
    for (int i = 0; i < 3; ++i)
        enu[i] = r[i] * camera[0] + r[3 + i] * camera[1] + r[6 + i] * camera[2] + pose.centre[i];
    return {kA + enu[2], enu[0], enu[1]};
}

}  // namespace

// Ground to image equals OpenCV's projectPoints and fisheye.projectPoints (plus half a pixel,
// for the corner-based image positions) on random points across the view.
TEST(FrameCamera, ProjectsAsOpenCv) {
    const std::string python = PythonWithOpenCv();
    if (python.empty())
        GTEST_SKIP() << "python3 with cv2 (python3-opencv) is not available";
    TempDir dir;
    const std::array<double, 3> axisAngle = {2.9, 0.3, -0.2};  // looking down, turned
    for (const CameraIntrinsics& c : {Brown(), Fisheye()}) {
        const CameraPose pose = EquatorPose(axisAngle);
        const auto model = kestrel::mathmodel::MakeFrameCameraModel(c, pose, "test");
        std::mt19937 random(5);
        const double field = c.lens == LensType::Fisheye ? 1.5 : 0.6;
        std::uniform_real_distribution<double> angle(-field, field), depth(50, 800);
        std::vector<std::array<double, 3>> camera;
        std::vector<double> x, y, z;
        for (int i = 0; i < 200; ++i) {
            const double d = depth(random);
            camera.push_back({angle(random) * d, angle(random) * d, d});
            const auto g = ToEcef(pose, camera.back());
            x.push_back(g[0]), y.push_back(g[1]), z.push_back(g[2]);
        }
        const auto expected = OpenCvProject(python, dir, c, camera);
        ASSERT_EQ(expected.size(), camera.size());
        std::vector<double> col(x.size()), row(x.size());
        std::unique_ptr<bool[]> ok(new bool[x.size()]);
        model->GroundToImage(x.size(), x.data(), y.data(), z.data(), col.data(), row.data(),
                             ok.get());
        for (std::size_t i = 0; i < x.size(); ++i) {
            ASSERT_TRUE(ok[i]) << i;
            EXPECT_NEAR(col[i], expected[i][0] + 0.5, 1e-6) << i;
            EXPECT_NEAR(row[i], expected[i][1] + 0.5, 1e-6) << i;
        }
        // Behind the camera there is no image.
        const auto behind = ToEcef(pose, {1, 1, -10});
        double bc, br;
        bool bok = true;
        model->GroundToImage(1, &behind[0], &behind[1], &behind[2], &bc, &br, &bok);
        EXPECT_FALSE(bok);
    }
}

// Image to ground at a height and back gives the image position again within a millionth of a
// pixel, in geographic and projected CRSs, with ellipsoidal and geoid heights.
TEST(FrameCamera, ImageToGroundAndBack) {
    struct Case {
        const char* crs;
        std::array<double, 3> centre;
        double ground;
    };
    const Case cases[] = {{"EPSG:4979", {9.19, 45.46, 1500}, 250},
                          {"EPSG:32632+5773", {515000, 5034000, 3000}, 120},
                          {"EPSG:32632", {515000, 5034000, 800}, 300}};
    for (const Case& k : cases) {
        for (const CameraIntrinsics& c : {Brown(), Fisheye()}) {
            CameraPose pose;
            pose.crs = k.crs;
            pose.centre = k.centre;
            pose.rotation = kestrel::mathmodel::RotationFromOpk(8, -5, 30);
            const auto model = kestrel::mathmodel::MakeFrameCameraModel(c, pose, "test");
            // The fisheye's corners look above the horizon.
            const double span = c.lens == LensType::Fisheye ? 0.5 : 0.9;
            std::vector<double> col, row, h;
            for (int j = 0; j <= 10; ++j)
                for (int i = 0; i <= 10; ++i) {
                    col.push_back(c.width * (0.5 + span * (0.1 * i - 0.5)));
                    row.push_back(c.height * (0.5 + span * (0.1 * j - 0.5)));
                    h.push_back(k.ground + 10 * ((i + j) % 5));
                }
            const std::size_t n = col.size();
            std::vector<double> x(n), y(n), c2(n), r2(n);
            std::unique_ptr<bool[]> ok(new bool[n]);
            model->ImageToGround(n, col.data(), row.data(), h.data(), x.data(), y.data(),
                                 ok.get());
            for (std::size_t i = 0; i < n; ++i)
                ASSERT_TRUE(ok[i]) << k.crs << " " << i;
            model->GroundToImage(n, x.data(), y.data(), h.data(), c2.data(), r2.data(), ok.get());
            for (std::size_t i = 0; i < n; ++i) {
                ASSERT_TRUE(ok[i]) << k.crs << " " << i;
                EXPECT_NEAR(c2[i], col[i], 1e-6) << k.crs << " " << i;
                EXPECT_NEAR(r2[i], row[i], 1e-6) << k.crs << " " << i;
            }
        }
    }
}

// The ortho of each sample image through its camera side file equals the ortho through the RPCs
// fitted to that camera: within a grey level on 99.9 % of the pixels both see, with visibility
// indexes that agree on 99.9 % of the grid.
TEST(FrameCamera, SampleOrthoEqualsTheOrthoThroughItsRpcs) {
    TempDir dir;
    samplecity::CityOptions options = samplecity::SmallCity();
    for (auto& c : options.cameras)
        c.width = c.height = 256;
    const samplecity::Sample sample = samplecity::MakeSample(dir.Path().string(), options, 2);
    samplecity::GridSurface surface(sample.dsmPath);
    const kestrel::ogc::cs::ICRS crs(options.crs);
    const double pixel = 0.5;
    const auto size = static_cast<unsigned int>(options.sizeX / pixel);
    for (const auto& image : sample.images) {
        ASSERT_TRUE(std::filesystem::exists(image.cameraPath));
        std::vector<std::vector<double>> bands[2];
        std::vector<double> visibility[2];
        for (int way = 0; way < 2; ++way) {
            // Segment 4: the camera side file; 1: the RPCs.
            std::unique_ptr<IMathModel> model(GetSrcModel(image.path, "", way == 0 ? 4 : 1));
            kestrel::processes::TorthoJob job;
            job.sourcePath = image.path;
            job.model = model.get();
            job.surface = &surface;
            job.crs = &crs;
            job.geocoding = kestrel::ogc::cs::GeocodingInfo::NorthUp(
                options.west, options.south + options.sizeY, pixel, pixel);
            job.pixels = job.lines = size;
            job.orthoPath = dir.File("ortho" + std::to_string(way) + ".tif");
            job.visibilityPath = dir.File("vis" + std::to_string(way) + ".tif");
            ASSERT_TRUE(kestrel::processes::TorthoGenerator().Generate(job).completed);
            for (int b = 1; b <= 3; ++b)
                bands[way].push_back(testsupport::ReadBand(job.orthoPath, b));
            visibility[way] = testsupport::ReadBand(job.visibilityPath);
        }
        const std::size_t n = visibility[0].size();
        ASSERT_EQ(n, static_cast<std::size_t>(size) * size);
        std::size_t seen = 0, close = 0, agree = 0;
        for (std::size_t i = 0; i < n; ++i) {
            agree += visibility[0][i] == visibility[1][i];
            if (visibility[0][i] != 1 || visibility[1][i] != 1)
                continue;
            ++seen;
            bool within = true;
            for (int b = 0; b < 3; ++b)
                within = within && std::fabs(bands[0][b][i] - bands[1][b][i]) <= 1.0;
            close += within;
        }
        EXPECT_GT(seen, n / 4) << image.path;
        EXPECT_GE(close, 0.999 * seen) << image.path << ": " << close << " of " << seen;
        EXPECT_GE(agree, 0.999 * n) << image.path << ": " << agree << " of " << n;
    }
}
