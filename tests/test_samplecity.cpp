// The synthetic aerial block: its nadir images through the true-ortho generator match the ideal
// image once their exposure gain is taken out, and the DSM handed to the workflow differs from the
// true one only at building edges, by at most the error asked for; both say their heights are
// ellipsoidal.
#include <gtest/gtest.h>

#include <cmath>
#include <cstdlib>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include <kestrel/crs.h>
#include <kestrel/elevation.h>
#include <kestrel/orthoutils.h>
#include <kestrel/trueortho.h>
#include <samplecity.h>

#include "program.h"
#include "rasterread.h"
#include "support.h"

using testsupport::ReadBand;
using testsupport::TempDir;

namespace {

TEST(SampleBlock, OrthosMatchTheIdealImageAndTheDsmErrorStaysAtEdges) {
    TempDir dir;
    samplecity::CityOptions options = samplecity::BlockCity(2, 2, 240, 0.5);
    options.exposureSpread = 20;
    options.dsmError = 2;
    options.idealPixel = 0.5;
    const samplecity::Sample sample = samplecity::MakeSample(dir.Path().string(), options, 2);
    ASSERT_EQ(sample.images.size(), 4u);
    ASSERT_NE(sample.dsmPath, sample.trueDsmPath);
    // Both DSMs say their heights are ellipsoidal (RPC heights are), so that a run without
    // --elevref does not take them for heights above the geoid.
    for (const std::string& dsm : {sample.dsmPath, sample.trueDsmPath}) {
        const auto vertical = kestrel::dem::ReadVerticalReference(dsm);
        EXPECT_TRUE(vertical.known && vertical.datum == kestrel::ogc::cs::DatumEllipsoid) << dsm;
    }

    // Gains drawn within the spread, seeded, and written to the notes as used.
    const std::string notes = testsupport::ReadFile(sample.notesPath);
    double lowest = 2, highest = 0;
    for (const auto& image : sample.images) {
        EXPECT_EQ(image.gain, samplecity::ExposureGain(options, &image - sample.images.data()));
        EXPECT_NE(notes.find(kestrel::FormatString("\"gain\": %.17g", image.gain)),
                  std::string::npos)
            << notes;
        lowest = std::min(lowest, image.gain), highest = std::max(highest, image.gain);
    }
    EXPECT_GE(lowest, 0.8);
    EXPECT_LE(highest, 1.2);
    EXPECT_GT(highest - lowest, 0.05);

    // Every image through its camera on the ideal image's grid and the true DSM: where it sees
    // the ground, its colours divided by its gain are the ideal image's.
    samplecity::GridSurface surface(sample.trueDsmPath);
    const kestrel::ogc::cs::ICRS crs(options.crs);
    const auto size = static_cast<unsigned int>(options.sizeX / options.idealPixel);
    const auto lines = static_cast<unsigned int>(options.sizeY / options.idealPixel);
    std::vector<double> ideal[3];
    for (int b = 0; b < 3; ++b)
        ideal[b] = ReadBand(sample.idealPath, b + 1);
    ASSERT_EQ(ideal[0].size(), static_cast<size_t>(size) * lines);
    for (const auto& image : sample.images) {
        std::unique_ptr<kestrel::mathmodel::IMathModel> model(
            GetSrcModel(image.path, "", 4));
        kestrel::processes::TorthoJob job;
        job.sourcePath = image.path;
        job.model = model.get();
        job.surface = &surface;
        job.crs = &crs;
        job.geocoding = kestrel::ogc::cs::GeocodingInfo::NorthUp(
            options.west, options.south + options.sizeY, options.idealPixel, options.idealPixel);
        job.pixels = size, job.lines = lines;
        job.orthoPath = dir.File("ortho.tif");
        job.visibilityPath = dir.File("vis.tif");
        ASSERT_TRUE(kestrel::processes::TorthoGenerator().Generate(job).completed);
        const std::vector<double> visibility = ReadBand(job.visibilityPath);
        size_t seen = 0, close = 0;
        for (int b = 0; b < 3; ++b) {
            const std::vector<double> ortho = ReadBand(job.orthoPath, b + 1);
            for (size_t i = 0; i < ortho.size(); ++i)
                if (visibility[i] == 1) {
                    ++seen;
                    close += std::fabs(ortho[i] / image.gain - ideal[b][i]) <= 10;
                }
        }
        EXPECT_GT(seen, 3u * 200 * 200) << image.path;
        // Walls and roof edges, blurred by resampling, make most of the rest.
        EXPECT_GT(close, 0.93 * seen) << image.path;
    }

    // The DSM's errors: posts that differ from the true DSM lie within dsmError pixels of a
    // true building edge, and every building has some.
    const std::vector<double> handed = ReadBand(sample.dsmPath), truth = ReadBand(sample.trueDsmPath);
    const samplecity::Dsm dsm(options);
    const auto w = static_cast<int>(dsm.Width()), h = static_cast<int>(dsm.Height());
    ASSERT_EQ(handed.size(), truth.size());
    size_t moved = 0, far = 0;
    std::vector<bool> touched(options.buildings.size() + 1, false);
    const int reach = static_cast<int>(options.dsmError);
    for (int j = 0; j < h; ++j)
        for (int i = 0; i < w; ++i) {
            if (std::fabs(handed[j * w + i] - truth[j * w + i]) < 0.5)
                continue;
            ++moved;
            bool nearEdge = false;
            for (int dj = -reach; dj <= reach; ++dj)
                for (int di = -reach; di <= reach; ++di) {
                    const int ii = std::clamp(i + di, 0, w - 1), jj = std::clamp(j + dj, 0, h - 1);
                    const double dx = options.dsmPixel;
                    const int id = dsm.BuildingAt(options.west + (ii + 0.5) * dx,
                                                  options.south + options.sizeY - (jj + 0.5) * dx);
                    nearEdge |= std::fabs(truth[jj * w + ii] - truth[j * w + i]) >= 0.5;
                    touched[id] = true;
                }
            far += !nearEdge;
        }
    EXPECT_GT(moved, options.buildings.size() * 8);
    EXPECT_EQ(far, 0u);
    size_t untouched = 0;
    for (size_t k = 1; k < touched.size(); ++k)
        untouched += !touched[k];
    EXPECT_EQ(untouched, 0u);
}

#ifdef SILVAN_MAKE_SAMPLE_EXE
// A value that cannot be used stops the command with status 2 and a message naming the option
// and the value, before anything is written.
TEST(SampleBlock, BadOptionValuesAreRefusedByName) {
    TempDir dir;
    const std::string program = SILVAN_MAKE_SAMPLE_EXE;
    const std::vector<std::vector<std::string>> cases = {
        {"--block", "3x"},          {"--block", "0x4"},          {"--block", "3x4x5"},
        {"--exposure-spread", "100"}, {"--exposure-spread", "-1"}, {"--dsm-error", "1.5"},
        {"--dsm-error", "21"},      {"--seed", "x"},
    };
    for (const auto& args : cases) {
        const auto result =
            testsupport::RunProgram(program, {dir.File("out"), args[0], args[1]}, dir);
        EXPECT_EQ(result.status, 2) << args[0] << " " << args[1];
        EXPECT_NE(result.err.find(args[0] + " needs"), std::string::npos) << result.err;
        EXPECT_NE(result.err.find("\"" + args[1] + "\""), std::string::npos) << result.err;
    }
    EXPECT_FALSE(std::filesystem::exists(dir.File("out")));
}
#endif

}  // namespace
