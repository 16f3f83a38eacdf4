// silvan-make-sample: writes the synthetic sample city (DSM, oblique RPC images, master file).
#include <samplecity.h>

#include <kestrel/exception.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <string>

namespace {

void Usage(std::FILE* out) {
    std::fprintf(out,
                 "Usage: silvan-make-sample DIR [--box] [--image-size N] [--threads N] [--quiet]\n"
                 "Writes into DIR a synthetic city: dsm.tif (Float32, EPSG:32632, ellipsoidal\n"
                 "heights), oblique images with fitted RPCs (north.tif, east.tif, ...) and\n"
                 "master.txt, the master parameter file that names the images.\n"
                 "  --box           one box building seen from two opposite sides instead\n"
                 "  --image-size N  image width and height in pixels (default 256; the images of\n"
                 "                  larger ones see beyond the sample's ground model)\n"
                 "  --threads N     rendering threads (default: all cores)\n");
}

unsigned int Number(const char* option, const char* text) {
    char* end = nullptr;
    const long v = std::strtol(text, &end, 10);
    if (end == text || *end != '\0' || v < 1 || v > 100000) {
        std::fprintf(stderr,
                     "silvan-make-sample: %s needs a whole number from 1 to 100000, not \"%s\"\n",
                     option, text);
        std::exit(2);
    }
    return static_cast<unsigned int>(v);
}

}  // namespace

int main(int argc, char** argv) {
    std::string dir;
    bool box = false, quiet = false;
    unsigned int size = 256, threads = 0;
    for (int i = 1; i < argc; ++i) {
        const std::string a = argv[i];
        if (a == "--help" || a == "-h") {
            Usage(stdout);
            return 0;
        } else if (a == "--box") {
            box = true;
        } else if (a == "--quiet") {
            quiet = true;
        } else if ((a == "--image-size" || a == "--threads") && i + 1 < argc) {
            (a == "--threads" ? threads : size) = Number(argv[i], argv[i + 1]);
            ++i;
        } else if (!a.empty() && a[0] != '-' && dir.empty()) {
            dir = a;
        } else {
            std::fprintf(stderr, "silvan-make-sample: unexpected argument \"%s\"\n", a.c_str());
            Usage(stderr);
            return 2;
        }
    }
    if (dir.empty()) {
        Usage(stderr);
        return 2;
    }
    try {
        std::filesystem::create_directories(dir);
        samplecity::CityOptions options =
            box ? samplecity::BoxScene(20.0, {0.0, 180.0}) : samplecity::SmallCity();
        for (auto& camera : options.cameras)
            camera.width = camera.height = size;
        const auto start = std::chrono::steady_clock::now();
        const samplecity::Sample sample = samplecity::MakeSample(dir, options, threads);
        const double seconds =
            std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
        if (!quiet) {
            std::printf("surface model  %s\n", sample.dsmPath.c_str());
            for (const auto& image : sample.images)
                std::printf("image          %s (RPC fit within %.4f px)\n", image.path.c_str(),
                            image.rpcMaxResidual);
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
