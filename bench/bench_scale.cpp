// The workflow at survey scale: silvan-ortho on aerial blocks of 4, 16 and 64 nadir images of the
// same size (the sample's --block), each run a child process of its own. Per block: wall-clock
// and processor seconds per image, the child's peak resident memory, bytes written per scene
// (every file named after it), and the mosaic step: its time in the run (summary.json's
// "occlusion recovery") and runs that make the mosaic alone (the scenes kept), by default and
// doing what gdalwarp does (--seams pixel --balance none --blend-width 0: no seams to solve, no
// balance, no blending), against gdalwarp making a Cloud Optimized GeoTIFF of the same scene
// orthos on the mosaic's grid on one thread, with the mosaic's default creation options. The
// three alternate --repeat times; the table gives each one's processor time (range over the
// repeats) and the ratios to gdalwarp's of the same round. Time and memory per image should not
// grow with the block.
//
//   bench_scale [--blocks 2x2,4x4,8x8] [--image-size 1000] [--jobs 2] [--repeat 3] [--fresh]
//
// The blocks are made once into the scratch directory (--fresh makes them again); every run
// makes its outputs anew. gdalwarp must be on PATH.
#include <samplecity.h>

#include "support.h"

#include <gdal_priv.h>

#include <algorithm>
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
                         "[--repeat N] [--fresh]\n");
    std::exit(2);
}

}  // namespace

int main(int argc, char** argv) {
    std::vector<Block> blocks = {{2, 2}, {4, 4}, {8, 8}};
    unsigned int imageSize = 1000, jobs = 2, repeat = 3;
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
        } else if ((a == "--image-size" || a == "--jobs" || a == "--repeat") && i + 1 < argc) {
            const int v = std::atoi(argv[++i]);
            if (v < 1)
                Usage();
            (a == "--jobs" ? jobs : a == "--repeat" ? repeat : imageSize) = static_cast<unsigned int>(v);
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
                "Mpx | mosaic step s (in the run) | mosaic alone, default: cpu s | mosaic alone, "
                "as gdalwarp: cpu s | gdalwarp -of COG: cpu s | default / gdalwarp | as gdalwarp "
                "/ gdalwarp | load after |\n");
    std::printf("|---|---|---|---|---|---|---|---|---|---|---|---|---|\n");
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
        const std::string log = (scratch / ("ortho" + std::to_string(n) + ".log")).string();
        fs::remove_all(out);
        const std::vector<std::string> orthoArgs = {
            SILVAN_ORTHO_EXE, (sampleDir / "master.txt").string(), "--out", out.string(), "--dem",
            (sampleDir / "dsm.tif").string(), "--elevref", "ELLIPS", "--jobs",
            std::to_string(jobs), "--quiet"};
        const benchsupport::ChildRun ortho = benchsupport::RunMeasured(orthoArgs, log);
        if (ortho.status != 0) {
            std::printf("| %u | silvan-ortho failed with status %d: see %s |\n", n, ortho.status,
                        log.c_str());
            ++failures;
            continue;
        }
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

        // The mosaic alone (the scenes kept, the mosaic removed, so that the processor time is
        // its own), by default and as gdalwarp, and gdalwarp, in turn.
        std::vector<std::string> likeArgs = orthoArgs;
        likeArgs.insert(likeArgs.end(), {"--seams", "pixel", "--balance", "none", "--blend-width", "0"});
        const std::vector<std::string>* runs[] = {&orthoArgs, &likeArgs, &warp};
        std::vector<double> cpu[3];
        bool failed = false;
        for (unsigned int round = 0; round < repeat && !failed; ++round)
            for (int k = 0; k < 3 && !failed; ++k) {
                if (k < 2)
                    fs::remove(out / "mosaic.tif");
                const benchsupport::ChildRun run = benchsupport::RunMeasured(*runs[k], log);
                failed = run.status != 0;
                cpu[k].push_back(run.cpuSeconds);
            }
        if (failed) {
            std::printf("| %u | the mosaic alone or gdalwarp failed: see %s |\n", n, log.c_str());
            ++failures;
            continue;
        }
        // "min-max" of values, and of the ratios of a run to gdalwarp's in the same round.
        auto range = [](std::vector<double> v) {
            const auto [lo, hi] = std::minmax_element(v.begin(), v.end());
            char text[48];
            std::snprintf(text, sizeof text, *lo == *hi ? "%.2f" : "%.2f-%.2f", *lo, *hi);
            return std::string(text);
        };
        auto ratios = [&](int k) {
            std::vector<double> r;
            for (size_t i = 0; i < cpu[k].size(); ++i)
                r.push_back(cpu[k][i] / cpu[2][i]);
            return range(r);
        };
        std::printf("| %u | %.2f | %.2f | %.0f | %.2f | %.1f | %.1f | %s | %s | %s | %s | %s | %s |\n",
                    n, ortho.wallSeconds / n, ortho.cpuSeconds / n, ortho.peakBytes / 1048576.0,
                    written / 1048576.0 / n, width * static_cast<double>(height) / 1e6, mosaicStep,
                    range(cpu[0]).c_str(), range(cpu[1]).c_str(), range(cpu[2]).c_str(),
                    ratios(0).c_str(), ratios(1).c_str(), MachineLoad().c_str());
        std::fflush(stdout);
    }
    return failures == 0 ? 0 : 1;
}
