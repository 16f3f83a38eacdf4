// The true-ortho generator on synthetic scenes: the sample builder's RPC fit, hidden strips,
// roof positions, agreement with gdalwarp on visible ground, cancellation and bad input.
#include <samplecity.h>

#include "support.h"

#include <gdal_priv.h>

#include <cmath>
#include <cstdio>
#include <sstream>

#if defined(_WIN32)
#define popen _popen
#define pclose _pclose
#endif

namespace {

using testsupport::TempDir;

// Runs a command and returns what it printed.
std::string RunCommand(const std::string& command) {
    std::string out;
    FILE* pipe = popen(command.c_str(), "r");
    if (pipe == nullptr)
        return out;
    char buffer[4096];
    for (size_t n; (n = fread(buffer, 1, sizeof buffer, pipe)) > 0;)
        out.append(buffer, n);
    pclose(pipe);
    return out;
}

TEST(SampleCity, RpcsAgreeWithTheCameraThroughGdalsTransformer) {
    TempDir dir;
    samplecity::CityOptions options = samplecity::SmallCity();
    options.cameras.resize(2);
    for (auto& c : options.cameras)
        c.width = c.height = 128, c.groundSampleDistance = 2.0;
    const samplecity::Sample sample = samplecity::MakeSample(dir.Path().string(), options, 1);
    ASSERT_EQ(sample.images.size(), 2u);
    const kestrel::ogc::cs::ICRS utm(options.crs), wgs84("EPSG:4326");
    const kestrel::ogc::cs::CoordinateTransformation toGeographic(utm, wgs84);
    for (const auto& image : sample.images) {
        EXPECT_LT(image.rpcMaxResidual, 0.01);
        // Ground points spread over the scene and its height range.
        std::ostringstream input;
        std::vector<std::pair<double, double>> expected;
        for (double x : {514850.0, 514900.0, 514950.0, 515000.0})
            for (double h : {250.0, 262.0, 280.0}) {
                double lon = x, lat = 5033900.0 + (x - 514800) / 2, col, row;
                image.camera->Project(lon, lat, h, col, row);
                toGeographic.Transform(1, &lon, &lat);
                input.precision(12);
                input << lon << ' ' << lat << ' ' << h << '\n';
                expected.emplace_back(col, row);
            }
        testsupport::WriteFile(dir.File("ground.txt"), input.str());
        std::istringstream out(
            RunCommand("gdaltransform -i -rpc " + image.path + " < " + dir.File("ground.txt")));
        for (const auto& e : expected) {
            double col = 0, row = 0, z = 0;
            ASSERT_TRUE(out >> col >> row >> z);
            EXPECT_NEAR(col, e.first, 0.01);
            EXPECT_NEAR(row, e.second, 0.01);
        }
    }
}

}  // namespace
