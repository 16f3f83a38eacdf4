// Frame cameras: projections against OpenCV, image to ground and back, the photogrammetric
// angles, and the files cameras come from.
#include <gtest/gtest.h>

#include <array>
#include <cmath>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <memory>
#include <random>
#include <sstream>
#include <string>
#include <vector>

#include <gdal_priv.h>

#include <kestrel/exception.h>
#include <kestrel/mathmodel.h>
#include <kestrel/orthoutils.h>

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

namespace {

std::string WriteImage(const std::string& path, int width, int height) {
    GDALAllRegister();
    std::unique_ptr<GDALDataset> ds(GetGDALDriverManager()->GetDriverByName("GTiff")->Create(
        path.c_str(), width, height, 1, GDT_Byte, nullptr));
    return path;
}

std::array<double, 2> Project(const IMathModel& model, double x, double y, double z) {
    std::array<double, 2> image{};
    bool ok = false;
    model.GroundToImage(1, &x, &y, &z, &image[0], &image[1], &ok);
    EXPECT_TRUE(ok);
    return image;
}

}  // namespace

// Omega, phi, kappa in the classical convention: a camera 1000 m above the ground, f = 1000 px
// (a metre on the ground is a pixel), sees known ground points at known image positions.
TEST(FrameCamera, PhotogrammetricAnglesOnKnownCases) {
    const double H = 1000, rad = 3.14159265358979323846 / 180;
    struct Case {
        double omega, phi, kappa;
        double dx, dy;      // ground point from the nadir, metres east and north
        double col, row;    // its image position from the principal point
    };
    const Case cases[] = {
        {0, 0, 0, 100, 0, 100, 0},    // nadir, image top to the north: east is right
        {0, 0, 0, 0, 100, 0, -100},   // north is up
        {0, 0, 90, 0, 100, 100, 0},   // kappa 90: north is right
        {0, 0, 90, 100, 0, 0, 100},   // and east is down
        {10, 0, 0, 0, H * std::tan(10 * rad), 0, 0},   // omega tilts the view to the north
        {0, 10, 0, -H * std::tan(10 * rad), 0, 0, 0},  // phi to the west
        // omega first, then phi: the principal ray meets the ground at
        // (-H tan(phi) / cos(omega), H tan(omega)).
        {5, 10, 0, -H * std::tan(10 * rad) / std::cos(5 * rad), H * std::tan(5 * rad), 0, 0},
    };
    CameraIntrinsics c;
    c.width = c.height = 1000, c.fx = c.fy = 1000, c.cx = c.cy = 499.5;
    for (const Case& k : cases) {
        CameraPose pose;
        pose.crs = "EPSG:32632";
        pose.centre = {515000, 5034000, 250 + H};
        pose.rotation = kestrel::mathmodel::RotationFromOpk(k.omega, k.phi, k.kappa);
        const auto model = kestrel::mathmodel::MakeFrameCameraModel(c, pose, "test");
        const auto image = Project(*model, 515000 + k.dx, 5034000 + k.dy, 250);
        // The map's scale (0.9996) and earth curvature move points by up to 0.08 pixel here.
        EXPECT_NEAR(image[0] - 500, k.col, 0.1) << k.omega << " " << k.phi << " " << k.kappa;
        EXPECT_NEAR(image[1] - 500, k.row, 0.1) << k.omega << " " << k.phi << " " << k.kappa;
    }
}

// One camera, handed over three ways: a side file with omega, phi, kappa; a row of an
// exterior-orientation table (CSV with a header, or whitespace) with its interior-orientation
// file; the same angles given directly. All project alike.
TEST(FrameCamera, SideFileAndTableGiveTheSameCamera) {
    TempDir dir;
    const std::string image = WriteImage(dir.File("IMG_0042.tif"), 600, 400);
    const std::string intrinsics =
        R"("lens": "brown", "width": 600, "height": 400, "fx": 800, "fy": 801, "cx": 301.5,
        "cy": 198.25, "k1": -0.05, "k2": 0.01, "p1": 0.0003, "p2": -0.0002)";
    testsupport::WriteFile(dir.File("IMG_0042.camera.json"),
                           "{" + intrinsics + R"(, "crs": "EPSG:32632",
        "centre": [515010.5, 5034020.25, 900], "opk": [3.5, -2.25, 117])" + "}");
    testsupport::WriteFile(dir.File("camera.json"), "{" + intrinsics + "}");
    testsupport::WriteFile(dir.File("lens2.json"), "{" + intrinsics + "}");
    testsupport::WriteFile(dir.File("eo.csv"),
                           "image,X,Y,Z,omega,phi,kappa\n"
                           "IMG_0041.tif,515000,5034000,900,0,0,0\n"
                           "IMG_0042.tif,515010.5,5034020.25,900,3.5,-2.25,117\n");
    testsupport::WriteFile(dir.File("eo.txt"),
                           "# name X Y Z omega phi kappa camera\n"
                           "IMG_0042  515010.5 5034020.25 900  3.5 -2.25 117  lens2.json\n");
    CameraIntrinsics c;
    c.width = 600, c.height = 400, c.fx = 800, c.fy = 801, c.cx = 301.5, c.cy = 198.25;
    c.k1 = -0.05, c.k2 = 0.01, c.p1 = 0.0003, c.p2 = -0.0002;
    CameraPose pose;
    pose.crs = "EPSG:32632";
    pose.centre = {515010.5, 5034020.25, 900};
    pose.rotation = kestrel::mathmodel::RotationFromOpk(3.5, -2.25, 117);
    const auto direct = kestrel::mathmodel::MakeFrameCameraModel(c, pose, "test");
    std::vector<std::unique_ptr<IMathModel>> models;
    models.emplace_back(GetSrcModel(image, "", 0));
    models.emplace_back(kestrel::mathmodel::OpenCameraModel(image, dir.File("eo.csv"),
                                                            "EPSG:32632"));
    models.emplace_back(kestrel::mathmodel::OpenCameraModel(image, dir.File("eo.txt"),
                                                            "EPSG:32632"));
    for (const auto& model : models) {
        EXPECT_EQ(model->GetImageWidth(), 600u);
        for (double dx : {-80.0, 0.0, 95.0}) {
            const auto expected = Project(*direct, 515010 + dx, 5034020 - dx / 2, 260);
            const auto got = Project(*model, 515010 + dx, 5034020 - dx / 2, 260);
            EXPECT_NEAR(got[0], expected[0], 1e-9);
            EXPECT_NEAR(got[1], expected[1], 1e-9);
        }
    }
}

// An OpenSfM reconstruction: the shot of the image is found by its file name, its camera's
// normalised intrinsics become pixels and its pose (X_cam = R X + t, R from the rotation vector)
// sits in the topocentric frame at reference_lla. Checked against OpenSfM's projection formulas
// written out here, for each of its camera types.
TEST(FrameCamera, OpenSfmReconstructionProjectsAsOpenSfm) {
    TempDir dir;
    const int w = 640, h = 480;
    const std::string image = WriteImage(dir.File("DJI_0007.JPG.tif"), w, h);
    struct Lens {
        const char* json;
        std::function<void(double x, double y, double& xn, double& yn)> project;
    };
    const Lens lenses[] = {
        {R"("projection_type": "perspective", "focal": 0.9, "k1": -0.1, "k2": 0.02)",
         [](double x, double y, double& xn, double& yn) {
             const double r2 = x * x + y * y, d = 0.9 * (1 - 0.1 * r2 + 0.02 * r2 * r2);
             xn = d * x, yn = d * y;
         }},
        {R"("projection_type": "brown", "focal_x": 0.9, "focal_y": 0.91, "c_x": 0.01,
            "c_y": -0.02, "k1": -0.1, "k2": 0.02, "k3": 0.001, "p1": 0.001, "p2": -0.002)",
         [](double x, double y, double& xn, double& yn) {
             const double r2 = x * x + y * y;
             const double radial = 1 - 0.1 * r2 + 0.02 * r2 * r2 + 0.001 * r2 * r2 * r2;
             const double xd = x * radial + 2 * 0.001 * x * y - 0.002 * (r2 + 2 * x * x);
             const double yd = y * radial + 0.001 * (r2 + 2 * y * y) + 2 * -0.002 * x * y;
             xn = 0.9 * xd + 0.01, yn = 0.91 * yd - 0.02;
         }},
        {R"("projection_type": "fisheye", "focal": 0.5, "k1": 0.03, "k2": -0.01)",
         [](double x, double y, double& xn, double& yn) {
             const double r = std::hypot(x, y), t = std::atan(r);
             const double s = 0.5 * t * (1 + 0.03 * t * t - 0.01 * t * t * t * t) / r;
             xn = s * x, yn = s * y;
         }},
    };
    const std::array<double, 3> rotation = {3.0, 0.1, -0.2}, t = {5, -12, 80};
    for (const Lens& lens : lenses) {
        testsupport::WriteFile(
            dir.File("reconstruction.json"),
            std::string(R"([{"cameras": {"v2 dji 640 480 perspective 0.9": {"width": 640,
                "height": 480, )") + lens.json + R"(}},
              "shots": {"DJI_0007.JPG.tif": {"camera": "v2 dji 640 480 perspective 0.9",
                "rotation": [3.0, 0.1, -0.2], "translation": [5, -12, 80]}},
              "reference_lla": {"latitude": 0, "longitude": 0, "altitude": 0}}])");
        // Ground as geocentric coordinates; at (0, 0, 0) east-north-up is (a + up, east, north).
        const auto model = kestrel::mathmodel::OpenCameraModel(
            image, dir.File("reconstruction.json"), "EPSG:4978");
        const auto R = kestrel::mathmodel::RotationFromAxisAngle(rotation);
        for (const std::array<double, 3> p : {std::array<double, 3>{10, 20, -5},
                                              std::array<double, 3>{-30, 5, 2},
                                              std::array<double, 3>{0, -25, 0}}) {
            double cam[3];
            for (int i = 0; i < 3; ++i)
                cam[i] = R[i * 3] * p[0] + R[i * 3 + 1] * p[1] + R[i * 3 + 2] * p[2] + t[i];
            double xn, yn;
            lens.project(cam[0] / cam[2], cam[1] / cam[2], xn, yn);
            const auto got = Project(*model, kA + p[2], p[0], p[1]);
            EXPECT_NEAR(got[0], xn * w + (w - 1) / 2.0 + 0.5, 1e-6) << lens.json;
            EXPECT_NEAR(got[1], yn * w + (h - 1) / 2.0 + 0.5, 1e-6) << lens.json;
        }
    }
}

// Orientations that cannot be used are refused with the file and the image named.
TEST(FrameCamera, UnusableOrientationsAreNamed) {
    TempDir dir;
    const std::string image = WriteImage(dir.File("a.tif"), 100, 80);
    const std::string side = dir.File("a.camera.json");
    const std::string good =
        R"("width": 100, "height": 80, "fx": 90, "fy": 90, "cx": 49.5, "cy": 39.5,
        "crs": "EPSG:32632", "centre": [515000, 5034000, 500], "opk": [0, 0, 0])";
    testsupport::WriteFile(dir.File("eo.txt"), "b.tif 515000 5034000 500 0 0 0\n");
    testsupport::WriteFile(dir.File("camera.json"), R"({"width": 100, "height": 80,
        "fx": 90, "fy": 90, "cx": 49.5, "cy": 39.5})");
    testsupport::WriteFile(dir.File("rec.json"),
                           R"([{"cameras": {"c": {"projection_type": "spherical", "width": 100,
                           "height": 80}}, "shots": {"a.tif": {"camera": "c", "rotation": [0, 0, 0],
                           "translation": [0, 0, 0]}}, "reference_lla": {"latitude": 45,
                           "longitude": 9, "altitude": 0}}])");
    struct Case {
        const char* what;
        std::string sideFile;  // empty: none
        std::function<void()> call;
        std::vector<std::string> named;
    };
    const auto fromSide = [&] { std::unique_ptr<IMathModel>(GetSrcModel(image, "", 0)); };
    const Case cases[] = {
        {"unknown lens", R"({"lens": "orthographic", )" + good + "}", fromSide,
         {side, "unknown lens type \"orthographic\""}},
        {"no attitude", R"({"width": 100, "height": 80, "fx": 90, "fy": 90, "cx": 49.5,
            "cy": 39.5, "crs": "EPSG:32632", "centre": [515000, 5034000, 500]})",
         fromSide, {side, "opk"}},
        {"not a rotation", R"({"width": 100, "height": 80, "fx": 90, "fy": 90, "cx": 49.5,
            "cy": 39.5, "crs": "EPSG:32632", "centre": [515000, 5034000, 500],
            "rotation": [[1, 0, 0], [0, 1, 0], [0, 0, 2]]})",
         fromSide, {side, "not a rotation"}},
        {"image not in table", "",
         [&] { kestrel::mathmodel::OpenCameraModel(image, dir.File("eo.txt"), "EPSG:32632"); },
         {dir.File("eo.txt"), image, "no orientation"}},
        {"lens unknown to the reconstruction", "",
         [&] { kestrel::mathmodel::OpenCameraModel(image, dir.File("rec.json"), ""); },
         {dir.File("rec.json"), "a.tif", "unknown lens type \"spherical\""}},
    };
    for (const Case& k : cases) {
        std::filesystem::remove(side);
        if (!k.sideFile.empty())
            testsupport::WriteFile(side, k.sideFile);
        const std::string message = testsupport::ThrownMessage(k.call, k.what);
        for (const std::string& name : k.named)
            EXPECT_NE(message.find(name), std::string::npos) << k.what << ": " << message;
    }
    // A camera of another size than its image.
    testsupport::WriteFile(side, "{" + std::string(good).replace(good.find("80"), 2, "81") + "}");
    const std::string message = testsupport::ThrownMessage(fromSide);
    EXPECT_NE(message.find(side), std::string::npos) << message;
    EXPECT_NE(message.find("the camera of \"" + image + "\" is 100 x 81 pixels, the image 100 x 80"),
              std::string::npos)
        << message;
}
