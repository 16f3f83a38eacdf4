// silvan-make-sample: writes the synthetic sample city or an aerial block (DSM, frame images with
// fitted RPCs, master file).
#include <samplecity.h>

#include <kestrel/exception.h>

#include <chrono>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <string>

namespace {

void Usage(std::FILE* out) {
    std::fprintf(
        out,
        "Usage: silvan-make-sample DIR [--box | --block ROWSxCOLS] [--image-size N]\n"
        "                          [--exposure-spread PCT] [--dsm-error PX] [--seed N]\n"
        "                          [--threads N] [--quiet]\n"
        "Writes into DIR a synthetic city: dsm.tif (Float32, EPSG:32632 with ellipsoidal\n"
        "heights, the CRS in dsm.tif.aux.xml), oblique images with fitted RPCs (north.tif,\n"
        "east.tif, ...), master.txt, the master parameter file that names the images,\n"
        "ideal.tif (the ground seen from straight above at the images' resolution) and\n"
        "sample.json (how it was made).\n"
        "  --box              one box building seen from two opposite sides instead\n"
        "  --block ROWSxCOLS  an aerial block instead: ROWS flight strips of COLS nadir\n"
        "                     images (60 %% forward, 30 %% side overlap, 0.15 m), r01c01.tif, ...\n"
        "  --image-size N     image width and height in pixels (default 256, for a block\n"
        "                     1000; the city's larger images see beyond its ground model)\n"
        "  --exposure-spread PCT  each image's colours times a gain drawn within +-PCT %%\n"
        "                     (0 to under 100; the gains are in sample.json)\n"
        "  --dsm-error PX     dsm.tif with every building edge moved by 1 to PX DSM pixels\n"
        "                     (0 to 20); the images come from the true DSM, dsm_true.tif\n"
        "  --seed N           varies the texture, the gains and the DSM's errors (default 7)\n"
        "  --threads N        rendering threads (default: all cores)\n");
}

[[noreturn]] void BadValue(const char* option, const char* expected, const char* text) {
    std::fprintf(stderr, "silvan-make-sample: %s needs %s, not \"%s\"\n", option, expected, text);
    std::exit(2);
}

unsigned int Number(const char* option, const char* text, long low = 1, long high = 100000) {
    char* end = nullptr;
    const long v = std::strtol(text, &end, 10);
    if (end == text || *end != '\0' || v < low || v > high)
        BadValue(option,
                 kestrel::FormatString("a whole number from %ld to %ld", low, high).c_str(), text);
    return static_cast<unsigned int>(v);
}

}  // namespace

int main(int argc, char** argv) {
    std::string dir;
    bool box = false, quiet = false;
    unsigned int size = 0, threads = 0, rows = 0, cols = 0, dsmError = 0, seed = 7;
    double spread = 0;
    for (int i = 1; i < argc; ++i) {
        const std::string a = argv[i];
        const bool hasValue = i + 1 < argc;
        if (a == "--help" || a == "-h") {
            Usage(stdout);
            return 0;
        } else if (a == "--box") {
            box = true;
        } else if (a == "--quiet") {
            quiet = true;
        } else if ((a == "--image-size" || a == "--threads") && hasValue) {
            (a == "--threads" ? threads : size) = Number(argv[i], argv[i + 1]);
            ++i;
        } else if (a == "--dsm-error" && hasValue) {
            dsmError = Number(argv[i], argv[i + 1], 0, 20);
            ++i;
        } else if (a == "--seed" && hasValue) {
            seed = Number(argv[i], argv[i + 1], 0, 1000000000);
            ++i;
        } else if (a == "--exposure-spread" && hasValue) {
            char* end = nullptr;
            spread = std::strtod(argv[i + 1], &end);
            if (end == argv[i + 1] || *end != '\0' || !(spread >= 0 && spread < 100))
                BadValue(argv[i], "a percentage from 0 to under 100", argv[i + 1]);
            ++i;
        } else if (a == "--block" && hasValue) {
            const char* text = argv[i + 1];
            char* x = nullptr;
            const long r = std::strtol(text, &x, 10);
            char* end = nullptr;
            const long c = (x != text && (*x == 'x' || *x == 'X')) ? std::strtol(x + 1, &end, 10) : 0;
            if (end == nullptr || end == x + 1 || *end != '\0' || r < 1 || r > 50 || c < 1 || c > 50)
                BadValue(argv[i], "ROWSxCOLS, each from 1 to 50 (3x4)", text);
            rows = static_cast<unsigned int>(r), cols = static_cast<unsigned int>(c);
            ++i;
        } else if (!a.empty() && a[0] != '-' && dir.empty()) {
            dir = a;
        } else {
            std::fprintf(stderr, "silvan-make-sample: %s \"%s\"\n",
                         a.rfind("--", 0) == 0 && !hasValue ? "a value is missing after"
                                                            : "unexpected argument",
                         a.c_str());
            Usage(stderr);
            return 2;
        }
    }
    if (dir.empty() || (box && rows > 0)) {
        if (!dir.empty())
            std::fprintf(stderr, "silvan-make-sample: --box and --block exclude each other\n");
        Usage(stderr);
        return 2;
    }
    try {
        std::filesystem::create_directories(dir);
        samplecity::CityOptions options;
        if (rows > 0) {
            options = samplecity::BlockCity(rows, cols, size ? size : 1000);
        } else {
            options = box ? samplecity::BoxScene(20.0, {0.0, 180.0}) : samplecity::SmallCity();
            for (auto& camera : options.cameras)
                camera.width = camera.height = size ? size : 256;
        }
        options.seed = seed;
        options.exposureSpread = spread;
        options.dsmError = dsmError;
        options.idealPixel = options.cameras.front().groundSampleDistance;
        const auto start = std::chrono::steady_clock::now();
        const samplecity::Sample sample = samplecity::MakeSample(dir, options, threads);
        const double seconds =
            std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
        if (!quiet) {
            std::printf("surface model  %s\n", sample.dsmPath.c_str());
            if (sample.trueDsmPath != sample.dsmPath)
                std::printf("true surface   %s (dsm.tif's building edges moved by 1 to %u px)\n",
                            sample.trueDsmPath.c_str(), dsmError);
            for (const auto& image : sample.images)
                std::printf("image          %s (RPC fit within %.4f px, gain %.3f)\n",
                            image.path.c_str(), image.rpcMaxResidual, image.gain);
            std::printf("ideal image    %s\n", sample.idealPath.c_str());
            std::printf("master file    %s\n", sample.masterPath.c_str());
            std::printf("made in %.2f s\n", seconds);
        }
    } catch (const kestrel::Exception& e) {
        std::fprintf(stderr, "silvan-make-sample: %s\n", e.what());
        return 1;
    } catch (const std::exception& e) {
        std::fprintf(stderr, "silvan-make-sample: %s\n", e.what());
        return 1;
    }
    return 0;
}
