// The workflow at survey scale: silvan-ortho on aerial blocks of 4, 16 and 64 nadir images of the
// same size (the sample's --block), each run a child process of its own. Per block: wall-clock
// and processor seconds per image, the child's peak resident memory, bytes written per scene
// (every file named after it), and the mosaic step: its time in the run (summary.json's
// "occlusion recovery") and a second run that makes the mosaic alone (the scenes kept), against
// gdalwarp making a Cloud Optimized GeoTIFF of the same scene orthos on the mosaic's grid on one
// thread, with the mosaic's default creation options. Time and memory per image should not grow
// with the block.
//
//   bench_scale [--blocks 2x2,4x4,8x8] [--image-size 1000] [--jobs 2] [--fresh]
//
// The blocks are made once into the scratch directory (--fresh makes them again); every run
// makes its outputs anew. gdalwarp must be on PATH.
#include <samplecity.h>

#include "support.h"

#include <gdal_priv.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <regex>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

namespace {

namespace fs = std::filesystem;

struct Block {
    unsigned int rows = 0, cols = 0;
};

std::string ReadText(const fs::path& path) {
    std::ifstream in(path, std::ios::binary);
    std::stringstream s;
    s << in.rdbuf();
    return s.str();
}

// A number of summary.json's "timings", or -1.
double Timing(const std::string& summary, const std::string& step) {
    std::smatch m;
    const std::regex pattern("\"" + step + "\"\\s*:\\s*([0-9.eE+-]+)");
    return std::regex_search(summary, m, pattern) ? std::atof(m[1].str().c_str()) : -1;
}

// Bytes of the files in dir named after the scene: NAME.xml, NAME_ortho.tif, ...
std::uint64_t SceneBytes(const fs::path& dir, const std::string& name) {
    std::uint64_t bytes = 0;
    for (const auto& entry : fs::directory_iterator(dir)) {
        const std::string file = entry.path().filename().string();
        if (file.size() > name.size() && file.compare(0, name.size(), name) == 0 &&
            (file[name.size()] == '.' || file[name.size()] == '_'))
            bytes += entry.file_size();
    }
    return bytes;
}

std::string MachineLoad() {
#if defined(_WIN32)
    return "n/a";
#else
    const std::string text = ReadText("/proc/loadavg");
    return text.substr(0, text.find(' ', text.find(' ', text.find(' ') + 1) + 1));
#endif
}

[[noreturn]] void Usage() {
    std::fprintf(stderr, "Usage: bench_scale [--blocks 2x2,4x4,8x8] [--image-size N] [--jobs N] "
                         "[--fresh]\n");
    std::exit(2);
}

}  // namespace

int main(int argc, char** argv) {
    std::vector<Block> blocks = {{2, 2}, {4, 4}, {8, 8}};
    unsigned int imageSize = 1000, jobs = 2;
    bool fresh = false;
    for (int i = 1; i < argc; ++i) {
        const std::string a = argv[i];
        if (a == "--fresh") {
            fresh = true;
        } else if (a == "--blocks" && i + 1 < argc) {
            blocks.clear();
            std::stringstream list(argv[++i]);
            for (std::string item; std::getline(list, item, ',');) {
                Block b;
                if (std::sscanf(item.c_str(), "%ux%u", &b.rows, &b.cols) != 2 || !b.rows || !b.cols)
                    Usage();
                blocks.push_back(b);
            }
        } else if ((a == "--image-size" || a == "--jobs") && i + 1 < argc) {
            const int v = std::atoi(argv[++i]);
            if (v < 1)
                Usage();
            (a == "--jobs" ? jobs : imageSize) = static_cast<unsigned int>(v);
        } else {
            Usage();
        }
    }
    GDALAllRegister();
    const fs::path scratch = benchsupport::ScratchDir("scale");
    std::printf("silvan-ortho on aerial blocks of %u x %u images (0.15 m, 60 %% / 30 %% overlap), "
                "--jobs %u, %u hardware threads; load average before: %s\n\n",
                imageSize, imageSize, jobs, std::thread::hardware_concurrency(),
                MachineLoad().c_str());
    std::printf("| images | wall s / image | cpu s / image | peak MB | MB written / scene | mosaic "
                "Mpx | mosaic step s (in the run) | mosaic alone: wall / cpu s | gdalwarp -of COG: "
                "wall / cpu s | load after |\n");
    std::printf("|---|---|---|---|---|---|---|---|---|---|\n");
    int failures = 0;
    for (const Block& block : blocks) {
        const unsigned int n = block.rows * block.cols;
        const fs::path sampleDir =
            scratch / ("block" + std::to_string(block.rows) + "x" + std::to_string(block.cols) +
                       "_" + std::to_string(imageSize));
        if (fresh || !fs::exists(sampleDir / "master.txt")) {
            fs::remove_all(sampleDir);
            fs::create_directories(sampleDir);
            samplecity::MakeSample(sampleDir.string(),
                                   samplecity::BlockCity(block.rows, block.cols, imageSize));
        }
        const fs::path out = scratch / ("out" + std::to_string(n));
        fs::remove_all(out);
        const std::vector<std::string> orthoArgs = {
            SILVAN_ORTHO_EXE, (sampleDir / "master.txt").string(), "--out", out.string(), "--dem",
            (sampleDir / "dsm.tif").string(), "--elevref", "ELLIPS", "--jobs",
            std::to_string(jobs), "--quiet"};
        const benchsupport::ChildRun ortho = benchsupport::RunMeasured(
            orthoArgs, (scratch / ("ortho" + std::to_string(n) + ".log")).string());
        if (ortho.status != 0) {
            std::printf("| %u | silvan-ortho failed with status %d: see %s |\n", n, ortho.status,
                        (scratch / ("ortho" + std::to_string(n) + ".log")).string().c_str());
            ++failures;
            continue;
        }
        // The mosaic alone: a second run with the scenes kept and the mosaic removed, so that its
        // processor time is its own.
        fs::remove(out / "mosaic.tif");
        const benchsupport::ChildRun mosaic = benchsupport::RunMeasured(
            orthoArgs, (scratch / ("mosaic" + std::to_string(n) + ".log")).string());
        std::uint64_t written = 0;
        std::vector<std::string> orthos;
        const samplecity::CityOptions city = samplecity::BlockCity(block.rows, block.cols, imageSize);
        for (const auto& camera : city.cameras) {
            written += SceneBytes(out, camera.name);
            orthos.push_back((out / (camera.name + "_ortho.tif")).string());
        }
        const double mosaicStep = Timing(ReadText(out / "summary.json"), "occlusion recovery");

        // gdalwarp of the same orthos onto the mosaic's grid, on one thread.
        double gt[6] = {0, 1, 0, 0, 0, -1};
        int width = 0, height = 0;
        {
            std::unique_ptr<GDALDataset> grid(GDALDataset::Open(
                (out / "mosaic.tif").string().c_str(), GDAL_OF_RASTER | GDAL_OF_READONLY));
            if (grid) {
                grid->GetGeoTransform(gt);
                width = grid->GetRasterXSize(), height = grid->GetRasterYSize();
            }
        }
        auto number = [](double v) {
            char text[32];
            std::snprintf(text, sizeof text, "%.10g", v);
            return std::string(text);
        };
        std::vector<std::string> warp = {
            "gdalwarp", "-q", "-overwrite", "-of", "COG", "-wo", "NUM_THREADS=1",
            "--config", "GDAL_NUM_THREADS", "1", "-te", number(gt[0]), number(gt[3] + height * gt[5]),
            number(gt[0] + width * gt[1]), number(gt[3]), "-ts", std::to_string(width),
            std::to_string(height), "-r", "near", "-co", "COMPRESS=DEFLATE", "-co",
            "PREDICTOR=YES", "-co", "LEVEL=5", "-co", "BLOCKSIZE=512", "-co",
            "OVERVIEW_RESAMPLING=AVERAGE"};
        warp.insert(warp.end(), orthos.begin(), orthos.end());
        warp.push_back((scratch / ("gdalwarp" + std::to_string(n) + ".tif")).string());
        const benchsupport::ChildRun gdalwarp =
            benchsupport::RunMeasured(warp, (scratch / ("gdalwarp" + std::to_string(n) + ".log")).string());
        if (mosaic.status != 0 || gdalwarp.status != 0) {
            std::printf("| %u | the mosaic alone (status %d) or gdalwarp (status %d) failed: see "
                        "%s |\n",
                        n, mosaic.status, gdalwarp.status, scratch.string().c_str());
            ++failures;
            continue;
        }
        std::printf("| %u | %.2f | %.2f | %.0f | %.2f | %.1f | %.1f | %.1f / %.1f | %.1f / %.1f | "
                    "%s |\n",
                    n, ortho.wallSeconds / n, ortho.cpuSeconds / n, ortho.peakBytes / 1048576.0,
                    written / 1048576.0 / n, width * static_cast<double>(height) / 1e6, mosaicStep,
                    mosaic.wallSeconds, mosaic.cpuSeconds, gdalwarp.wallSeconds,
                    gdalwarp.cpuSeconds, MachineLoad().c_str());
        std::fflush(stdout);
    }
    return failures == 0 ? 0 : 1;
}
