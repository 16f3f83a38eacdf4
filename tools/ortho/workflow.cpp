#include "workflow.h"

#include "files.h"

#include <silvan/parserfactory.h>
#include <silvan/tomfileparser.h>
#include <silvan/tosceneparser.h>
#include <silvan/tpmfileparser.h>

#include <kestrel/file.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <limits>
#include <map>
#include <mutex>
#include <sstream>
#include <thread>

namespace fs = std::filesystem;
using kestrel::processes::silvan::ParserFactory;
using kestrel::processes::silvan::TOImgSetParser;
using kestrel::processes::silvan::TOMFileParser;
using kestrel::processes::silvan::TOSceneParser;
using kestrel::processes::silvan::TPMFileParser;

namespace ortho {

namespace {

using Clock = std::chrono::steady_clock;

double SecondsSince(Clock::time_point start) {
    return std::chrono::duration<double>(Clock::now() - start).count();
}

std::string Join(const std::string& directory, const std::string& name) {
    return (fs::path(directory) / name).string();
}

// A message about a file, naming it once.
std::string About(const std::string& path, const std::string& message) {
    return message.find(path) != std::string::npos ? message : path + ": " + message;
}

// The line numbers (from 1) of the data lines of a parameter file: every line but header and
// comment lines ("!" first) and blank ones, as the parameter-table reader counts them.
std::vector<unsigned int> DataLineNumbers(const std::string& path) {
    std::vector<unsigned int> numbers;
    std::ifstream in(path, std::ios::binary);
    std::string text;
    unsigned int number = 0;
    while (std::getline(in, text)) {
        ++number;
        if (number == 1 && text.compare(0, 3, "\xEF\xBB\xBF") == 0)
            text.erase(0, 3);
        if (!text.empty() && text.back() == '\r')
            text.pop_back();
        if (text.empty() || text[0] == '!' || text.find_first_not_of(" \t") == std::string::npos)
            continue;
        numbers.push_back(number);
    }
    return numbers;
}

std::string ReadText(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    std::ostringstream text;
    text << in.rdbuf();
    return text.str();
}

// Writes a derived file through write(partName) and puts it in place, unless the file there
// already holds the same bytes (so that a rerun changes nothing).
template <typename Write>
void DeriveFile(const std::string& path, Write write) {
    const std::string part = UniquePartName(path);
    try {
        write(part);
    } catch (...) {
        RemoveFile(part);
        throw;
    }
    if (!FileExists(part))
        KESTREL_THROW(kestrel::FileAccessException, path,
                      kestrel::FileAccessException::CreateFailed, "cannot be created");
    if (FileExists(path) && ReadText(path) == ReadText(part))
        RemoveFile(part);
    else
        Publish(part, path);
}

// FNV-1a: a stable fingerprint of the inputs the common grid depends on.
std::string Fingerprint(const std::string& text) {
    std::uint64_t hash = 1469598103934665603ULL;
    for (const char c : text) {
        hash ^= static_cast<unsigned char>(c);
        hash *= 1099511628211ULL;
    }
    char hex[17];
    std::snprintf(hex, sizeof hex, "%016llx", static_cast<unsigned long long>(hash));
    return hex;
}

std::string GridText(const std::string& key, const Grid& grid) {
    std::ostringstream out;
    out.precision(17);
    out << key << '\n' << grid.pixels << ' ' << grid.lines << '\n';
    for (const double g : grid.geoTransform)
        out << g << ' ';
    out << '\n' << grid.crs << '\n';
    return out.str();
}

bool ReadGridText(const std::string& path, const std::string& key, Grid& grid) {
    std::ifstream in(path);
    std::string storedKey;
    if (!std::getline(in, storedKey) || storedKey != key)
        return false;
    Grid read;
    in >> read.pixels >> read.lines;
    for (double& g : read.geoTransform)
        in >> g;
    in >> std::ws;
    if (!in || !std::getline(in, read.crs) || read.crs.empty() || read.pixels == 0 ||
        read.lines == 0)
        return false;
    grid = read;
    return true;
}

std::string FactorsText(const std::vector<float>& factors) {
    std::string text;
    for (const float f : factors)
        text += std::to_string(f) + ",";
    return text;
}

// Scene descriptions go through the XML library one at a time: the DTD beside them is written
// by whichever scene finds it missing.
std::mutex& SceneFileMutex() {
    static std::mutex mutex;
    return mutex;
}

}  // namespace

Workflow::Workflow(const Options& options, Progress& progress)
    : options_(options), progress_(progress) {}

std::string Workflow::Where(const Scene& scene) const {
    return options_.master + ", line " + std::to_string(scene.masterLine);
}

void Workflow::AddStep(const std::string& step, double seconds) {
    std::lock_guard<std::mutex> lock(stepMutex_);
    for (auto& entry : stepSeconds_) {
        if (entry.first == step) {
            entry.second += seconds;
            return;
        }
    }
    stepSeconds_.emplace_back(step, seconds);
}

void Workflow::Fail(Scene& scene, const std::string& message) {
    scene.status = "failed";
    scene.error = message;
    if (!options_.keepGoing)
        stopped_ = true;
}

int Workflow::Run() {
    summary_.master = options_.master;
    const auto start = Clock::now();
    bool succeeded = false;
    try {
        auto step = Clock::now();
        Prepare();
        summary_.timings.emplace_back("prepare", SecondsSince(step));
        const bool anyScene =
            std::any_of(scenes_.begin(), scenes_.end(), [](const Scene& s) { return s.inSlice; });
        if (!anyScene)
            stopped_ = stopped_ || !options_.hasLines;
        step = Clock::now();
        if (anyScene)
            MakeGrid();
        summary_.timings.emplace_back("grid", SecondsSince(step));
        step = Clock::now();
        if (!stopped_ && anyScene)
            RunScenes();
        summary_.timings.emplace_back("scenes", SecondsSince(step));
        step = Clock::now();
        if (!stopped_ && anyScene && !options_.hasLines)
            Recover();
        summary_.timings.emplace_back("recovery", SecondsSince(step));
        succeeded = !stopped_ && summary_.errors.empty();
        for (const Scene& scene : scenes_) {
            if (scene.inSlice && scene.status != "done" && scene.status != "complete")
                succeeded = false;
        }
    } catch (const RunError& e) {
        summary_.errors.push_back(e.what());
        progress_.Error(e.what());
    } catch (const std::exception& e) {
        summary_.errors.push_back(Explain(e));
        progress_.Error(Explain(e));
    }
    summary_.timings.emplace_back("total", SecondsSince(start));
    for (const auto& entry : stepSeconds_)
        summary_.timings.push_back(entry);
    Finish(succeeded);
    return succeeded ? 0 : 1;
}

void Workflow::Prepare() {
    std::error_code ec;
    const fs::path out = fs::absolute(options_.outDir, ec);
    if (ec)
        throw RunError(options_.outDir + ": " + ec.message());
    fs::create_directories(out, ec);
    if (ec || !fs::is_directory(out))
        throw RunError(options_.outDir + ": the output directory cannot be created" +
                       (ec ? ": " + ec.message() : std::string()));
    outDir_ = out.lexically_normal().string();
    prepFile_ = Join(outDir_, "prep.txt");
    imgSetFile_ = Join(outDir_, "imgset.txt");
    gridFile_ = Join(outDir_, "grid.txt");

    // The master file gives the two derived files; the process reads them back as the
    // preparation and gap-filling processes would.
    try {
        std::unique_ptr<TOMFileParser> master(ParserFactory::CreateTOMFileParser(options_.master));
        DeriveFile(prepFile_, [&](const std::string& part) { master->WriteMFilePrep(part); });
        DeriveFile(imgSetFile_, [&](const std::string& part) { master->WriteImgSet(part); });
    } catch (const kestrel::Exception& e) {
        throw RunError(About(options_.master, Explain(e)));
    }
    const std::vector<unsigned int> masterLines = DataLineNumbers(options_.master);

    std::map<std::string, std::pair<RadiometricDiff, int>> imageSet;
    try {
        std::unique_ptr<TOImgSetParser> set(
            ParserFactory::CreateImgSetParser(imgSetFile_, RadioDifAny, 0));
        for (unsigned int i = 0; i < set->GetMfileLines(); ++i) {
            set->ParseLine(static_cast<int>(i));
            imageSet[set->GetSceneId()] = {set->GetRadioDif(), set->GetDbmPxErr()};
        }
    } catch (const kestrel::ParameterException& e) {
        // Every line has a preparation role: there is nothing to recover.
        if (e.GetErrorMessage() != "Empty text file")
            throw RunError(About(imgSetFile_, Explain(e)));
    } catch (const kestrel::Exception& e) {
        throw RunError(About(imgSetFile_, Explain(e)));
    }

    std::vector<unsigned int> noChannels;  // a line without channels reads all of them
    std::vector<int> noWindow;
    std::unique_ptr<TPMFileParser> prep;
    try {
        prep.reset(ParserFactory::CreateTPMFileParser(prepFile_, noChannels, 0, noWindow, "", 0));
    } catch (const kestrel::Exception& e) {
        throw RunError(About(options_.master, Explain(e)));
    }
    const unsigned int count = prep->GetMfileLines();
    const fs::path masterDir = fs::absolute(options_.master, ec).parent_path();
    std::map<std::string, int> names;
    for (unsigned int i = 0; i < count; ++i) {
        Scene scene;
        scene.line = static_cast<int>(i);
        scene.masterLine = i < masterLines.size() ? masterLines[i] : i + 1;
        scene.inSlice = !options_.hasLines || (i >= options_.firstLine && i < options_.endLine);
        try {
            prep->ParseLine(scene.line);
            scene.given = prep->GetFili();
            scene.input.channels = prep->GetDbic();
            scene.input.mmseg = prep->GetMmseg();
            scene.input.dbiw = prep->GetDbiw();
            scene.input.srcBgd = prep->GetSrcBgd();
            scene.input.edgeClip = prep->GetEdgeClip();
        } catch (const kestrel::Exception& e) {
            // The preparation file's lines are the master file's: name the master line.
            std::string message = Explain(e);
            const std::string prefix = prepFile_ + ", line ";
            const auto comma = message.find(", ", prefix.size());
            if (message.compare(0, prefix.size(), prefix) == 0 && comma != std::string::npos)
                message = message.substr(comma + 2);
            scene.given = prep->GetFili();
            scene.error =
                Where(scene) + (message.compare(0, 7, "column ") == 0 ? ", " : ": ") + message;
        }
        if (scene.error.empty() && scene.given.empty())
            scene.error = Where(scene) + ": the source image is missing";
        if (scene.error.empty()) {
            // A relative source is taken from the master file's directory, or else from the
            // current one.
            fs::path source(scene.given);
            if (source.is_relative() &&
                (fs::exists(masterDir / source, ec) || !fs::exists(source, ec)))
                source = masterDir / source;
            scene.input.source = fs::absolute(source, ec).lexically_normal().string();
            scene.id = kestrel::core::fileio::File(scene.given).GetBasename();
            scene.name = fs::path(scene.id).stem().string();
            const auto known = imageSet.find(scene.id);
            if (known != imageSet.end()) {
                scene.inImageSet = true;
                scene.radioDif = known->second.first;
                scene.dbmPxErr = known->second.second;
            }
            const auto used = names.find(scene.name);
            if (scene.name.empty() || scene.name == "mosaic" || scene.name == "footprints") {
                scene.error =
                    Where(scene) + ": \"" + scene.given + "\" cannot name a scene's outputs";
            } else if (used != names.end()) {
                scene.error =
                    Where(scene) + ": the scene name \"" + scene.name +
                    "\" is already taken by line " +
                    std::to_string(scenes_[static_cast<std::size_t>(used->second)].masterLine) +
                    " (outputs and image-set entries are named after the source file)";
            } else {
                names[scene.name] = scene.line;
            }
        }
        if (!scene.name.empty()) {
            scene.ortho = Join(outDir_, scene.name + "_ortho." + options_.format);
            scene.visibility = Join(outDir_, scene.name + "_vis." + options_.format);
            scene.xml = Join(outDir_, scene.name + ".xml");
            scene.footprint = Join(outDir_, scene.name + "_footprint.gpkg");
            scene.quicklook = Join(outDir_, scene.name + "_vis.png");
        }
        if (!scene.error.empty() && scene.inSlice) {
            progress_.Error(scene.error);
            Fail(scene, scene.error);
        }
        scenes_.push_back(std::move(scene));
    }
    if (options_.hasLines && options_.firstLine >= count)
        progress_.Info("--lines " + std::to_string(options_.firstLine) + ":...: " + prepFile_ +
                       " has " + std::to_string(count) + " lines; nothing to do");
}

void Workflow::MakeGrid() {
    // The grid depends on the surface, the output options and every line's source.
    std::string inputs = options_.dem + "|" + options_.tin + "|" + options_.elevref + "|" +
                         FactorsText(options_.elfactor) + "|" + options_.elunits + "|" +
                         options_.srs + "|" + std::to_string(options_.pixelSize) + "|" +
                         options_.cameras + "|" + options_.camerasSrs + "|";
    for (const Scene& scene : scenes_) {
        if (!scene.error.empty())
            continue;
        inputs += scene.input.source + ";" + std::to_string(scene.input.mmseg) + ";";
        for (const unsigned int c : scene.input.channels)
            inputs += std::to_string(c) + ",";
        inputs += "\n";
    }
    const std::string key = Fingerprint(inputs);
    if (ReadGridText(gridFile_, key, grid_))
        return;

    // The first scene whose layout can be made fixes the CRS and pixel size of all others.
    std::vector<Grid> grids;
    std::string crs = options_.srs;
    double pixelSize = options_.pixelSize;
    for (Scene& scene : scenes_) {
        if (!scene.error.empty() || stopped_)
            continue;
        try {
            scene.grid = SceneLayout(options_, scene.input, crs, pixelSize, nullptr);
            scene.hasGrid = true;
            grids.push_back(scene.grid);
            if (grids.size() == 1) {
                crs = scene.grid.crs;
                pixelSize = scene.grid.PixelSize();
            }
        } catch (const std::exception& e) {
            scene.error = Where(scene) + ": " + Explain(e);
            if (scene.inSlice) {
                progress_.Error(scene.error);
                Fail(scene, scene.error);
            }
        }
    }
    if (stopped_)
        return;
    if (grids.empty())
        throw RunError(options_.master + ": no scene has a usable layout");
    grid_ = CommonGrid(grids);
    WriteFileAtomically(gridFile_, GridText(key, grid_));
    progress_.Info("common grid: " + grid_.Describe());
}

bool Workflow::IsComplete(const Scene& scene) const {
    if (!FileExists(scene.xml) || !FileExists(scene.footprint) || !FileExists(scene.quicklook))
        return false;
    // Made before its inputs last changed: make it again.
    const double made = ModifiedTime(scene.xml);
    if (made < ModifiedTime(scene.input.source) ||
        made < ModifiedTime(options_.dem.empty() ? options_.tin : options_.dem))
        return false;
    // So does the file of its camera.
    const std::string camera = options_.cameras.empty()
                                   ? kestrel::mathmodel::CameraSideFile(scene.input.source)
                                   : options_.cameras;
    if (FileExists(camera) && made < ModifiedTime(camera))
        return false;
    try {
        std::unique_ptr<TOSceneParser> description;
        {
            std::lock_guard<std::mutex> lock(SceneFileMutex());
            description.reset(ParserFactory::CreateSceneParser(scene.xml));
        }
        if (description->GetOrthoFilename() != scene.ortho ||
            description->GetVisIdxFilename() != scene.visibility ||
            description->GetSceneFilename() != scene.input.source)
            return false;
        Grid ortho, visibility;
        return ReadGrid(scene.ortho, ortho) && ortho.SameAs(grid_) &&
               ReadGrid(scene.visibility, visibility) && visibility.SameAs(grid_);
    } catch (const std::exception&) {
        return false;
    }
}

void Workflow::RunScenes() {
    std::vector<Scene*> queue;
    for (Scene& scene : scenes_) {
        if (!scene.inSlice || !scene.error.empty())
            continue;
        if (IsComplete(scene)) {
            scene.status = "complete";
            continue;
        }
        queue.push_back(&scene);
    }
    const unsigned int skipped = static_cast<unsigned int>(std::count_if(
        scenes_.begin(), scenes_.end(), [](const Scene& s) { return s.status == "complete"; }));
    if (skipped > 0)
        progress_.Info(std::to_string(skipped) + " scene(s) complete from an earlier run");
    if (queue.empty())
        return;
    progress_.SetTotal(static_cast<unsigned int>(queue.size()));

    std::mutex mutex;
    std::size_t next = 0;
    std::atomic<bool> stop{false};
    const auto work = [&]() {
        for (;;) {
            Scene* scene = nullptr;
            {
                std::lock_guard<std::mutex> lock(mutex);
                if (next == queue.size())
                    return;
                scene = queue[next++];
                if (stop) {
                    scene->status = "not run";
                    continue;
                }
            }
            RunScene(*scene);
            if (scene->status == "failed" && !options_.keepGoing)
                stop = true;
        }
    };
    const unsigned int threads =
        std::min<unsigned int>(options_.jobs, static_cast<unsigned int>(queue.size()));
    std::vector<std::thread> workers;
    for (unsigned int i = 1; i < threads; ++i)
        workers.emplace_back(work);
    work();
    for (std::thread& worker : workers)
        worker.join();
    if (stop)
        stopped_ = true;
}

void Workflow::RunScene(Scene& scene) {
    const auto start = Clock::now();
    const std::string label = scene.name;
    progress_.Begin(label);
    // Step weights for the scene's progress.
    const auto report = [&](double from, double to, const std::string& step) {
        return [this, label, from, to, step](double fraction) {
            progress_.Update(label, from + (to - from) * fraction, step);
            return true;
        };
    };
    const std::vector<std::string> parts = {PartName(scene.ortho), PartName(scene.visibility),
                                            PartName(scene.quicklook), PartName(scene.xml)};
    try {
        // Outputs of an earlier, unfinished attempt are made again from the start.
        for (const std::string& path :
             {scene.xml, scene.ortho, scene.visibility, scene.footprint, scene.quicklook})
            RemoveFile(path);
        for (const std::string& part : parts)
            RemoveFile(part);

        auto step = Clock::now();
        const auto timed = [&](const char* name) {
            AddStep(name, SecondsSince(step));
            step = Clock::now();
        };
        report(0.0, 0.05, "layout")(0.0);
        Footprint footprint;
        SceneLayout(options_, scene.input, grid_.crs, grid_.PixelSize(), &footprint);
        timed("scene layout");

        const OrthoResult result =
            MakeOrtho(options_, scene.input, grid_, parts[0], parts[1], report(0.05, 0.9, "ortho"));
        Publish(parts[0], scene.ortho);
        Publish(parts[1], scene.visibility);
        timed("scene ortho");

        // The footprint layer is labelled with its file's name, so it is written in place; the
        // scene description written after it says that it is whole.
        report(0.9, 0.95, "footprint")(0.0);
        WriteFootprint(scene.footprint, *footprint);
        timed("scene footprint");
        WriteQuicklook(scene.visibility, parts[2], Quicklook::Visibility);
        Publish(parts[2], scene.quicklook);
        timed("scene quicklook");

        // The scene description comes last: its presence says the scene is complete.
        report(0.95, 1.0, "scene")(0.0);
        {
            std::lock_guard<std::mutex> lock(SceneFileMutex());
            std::unique_ptr<TOSceneParser> description(ParserFactory::CreateSceneParser(parts[3]));
            description->SetSceneFilename(scene.input.source);
            description->SetOrthoFilename(scene.ortho);
            description->SetVisIdxFilename(scene.visibility);
            description->SetElevMapFilename(options_.dem.empty() ? options_.tin : options_.dem);
            description->SetMmseg(scene.input.mmseg);
            description->SetOrthoNoDataValue(static_cast<float>(result.orthoNoData));
            description->SetElevNoDataValue(static_cast<float>(result.elevationNoData));
            description->SetSceneFootprint(footprint.get());
            description->Serialize(false);
        }
        Publish(parts[3], scene.xml);
        timed("scene description");
        scene.status = "done";
    } catch (const std::exception& e) {
        for (const std::string& part : parts)
            RemoveFile(part);
        Fail(scene, Where(scene) + ": " + Explain(e));
    }
    scene.seconds = SecondsSince(start);
    progress_.End(label, scene.status == "done", scene.seconds, scene.error);
}

void Workflow::Recover() {
    const std::string mosaic = Join(outDir_, "mosaic." + options_.format);
    const std::string source = Join(outDir_, "mosaic_source." + options_.format);
    const std::string footprints = Join(outDir_, "footprints.gpkg");
    const std::string stamp = Join(outDir_, "mosaic.inputs");
    const std::vector<std::string> quicklooks = {Join(outDir_, "mosaic.png"),
                                                 Join(outDir_, "mosaic_source.png")};

    std::vector<RecoveryScene> inputs;
    std::vector<FootprintLayer> layers;
    std::string inputsText;
    double newest = -std::numeric_limits<double>::infinity();
    for (const Scene& scene : scenes_) {
        if (scene.status != "done" && scene.status != "complete")
            continue;
        newest = std::max(newest, ModifiedTime(scene.xml));
        layers.push_back({scene.name, scene.footprint, scene.input.source});
        inputsText += scene.name + (scene.inImageSet ? " fill\n" : " prep\n");
        if (!scene.inImageSet)
            continue;
        // The ortho and visibility index as the scene description records them.
        std::unique_ptr<TOSceneParser> description;
        {
            std::lock_guard<std::mutex> lock(SceneFileMutex());
            description.reset(ParserFactory::CreateSceneParser(scene.xml));
        }
        inputs.push_back({scene.id, scene.input.source, scene.input.mmseg,
                          description->GetOrthoFilename(), description->GetVisIdxFilename(),
                          scene.radioDif, scene.dbmPxErr});
    }
    if (layers.empty())
        return;

    // Nothing changed since the mosaic was made: keep it.
    bool upToDate = FileExists(stamp) && ReadText(stamp) == inputsText && FileExists(footprints) &&
                    ModifiedTime(footprints) >= newest;
    if (!inputs.empty()) {
        upToDate = upToDate && FileExists(mosaic) && FileExists(source) &&
                   ModifiedTime(mosaic) >= newest && FileExists(quicklooks[0]) &&
                   FileExists(quicklooks[1]);
    }
    if (upToDate) {
        progress_.Info("mosaic and footprints are up to date");
    } else {
        RemoveFile(stamp);
        progress_.Info("merging the footprints of " + std::to_string(layers.size()) + " scene(s)");
        auto step = Clock::now();
        MergeFootprints(layers, grid_, PartName(footprints));
        Publish(PartName(footprints), footprints);
        AddStep("footprint merge", SecondsSince(step));
        if (!inputs.empty()) {
            progress_.Info("occlusion recovery over " + std::to_string(inputs.size()) +
                           " scene(s) of the image set");
            progress_.SetTotal(1);
            progress_.Begin("recovery");
            const auto start = Clock::now();
            try {
                RecoverMosaic(options_, inputs, grid_, PartName(mosaic), PartName(source),
                              [this](double fraction) {
                                  progress_.Update("recovery", fraction, "mosaic");
                                  return true;
                              });
                Publish(PartName(mosaic), mosaic);
                Publish(PartName(source), source);
                AddStep("occlusion recovery", SecondsSince(start));
                step = Clock::now();
                WriteQuicklook(mosaic, PartName(quicklooks[0]), Quicklook::Image);
                Publish(PartName(quicklooks[0]), quicklooks[0]);
                WriteQuicklook(source, PartName(quicklooks[1]), Quicklook::SourceIndex);
                Publish(PartName(quicklooks[1]), quicklooks[1]);
                AddStep("mosaic quicklooks", SecondsSince(step));
            } catch (const std::exception& e) {
                for (const std::string& path : {mosaic, source, quicklooks[0], quicklooks[1]})
                    RemoveFile(PartName(path));
                progress_.End("recovery", false, SecondsSince(start), Explain(e));
                throw RunError(imgSetFile_ + ": occlusion recovery: " + Explain(e));
            }
            progress_.End("recovery", true, SecondsSince(start), "");
        }
        WriteFileAtomically(stamp, inputsText);
    }
    summary_.footprints = footprints;
    if (!inputs.empty()) {
        summary_.mosaic = mosaic;
        summary_.mosaicSource = source;
        for (const Scene& scene : scenes_) {
            if (scene.inImageSet && (scene.status == "done" || scene.status == "complete"))
                summary_.mosaicScenes.push_back(scene.name);
        }
        summary_.quicklooks = quicklooks;
    }
}

void Workflow::Finish(bool succeeded) {
    summary_.status = !succeeded ? "failed" : options_.hasLines ? "partial" : "complete";
    for (const Scene& scene : scenes_) {
        if (!scene.inSlice)
            continue;
        SceneSummary s;
        s.line = scene.line;
        s.source = scene.given;
        s.status = scene.status.empty() ? "not run" : scene.status;
        s.seconds = scene.seconds;
        s.error = scene.error;
        if (s.status == "done" || s.status == "complete") {
            s.ortho = scene.ortho;
            s.visibility = scene.visibility;
            s.scene = scene.xml;
            s.footprint = scene.footprint;
            summary_.quicklooks.push_back(scene.quicklook);
        }
        summary_.scenes.push_back(s);
    }
    if (outDir_.empty())
        return;
    const std::string name = options_.hasLines
                                 ? "summary-" + std::to_string(options_.firstLine) + "-" +
                                       (options_.endLine == std::numeric_limits<unsigned int>::max()
                                            ? std::string("end")
                                            : std::to_string(options_.endLine)) +
                                       ".json"
                                 : "summary.json";
    try {
        WriteFileAtomically(Join(outDir_, name), ToJson(summary_));
        summaryPath_ = Join(outDir_, name);
    } catch (const std::exception& e) {
        progress_.Error(Explain(e));
    }
}

}  // namespace ortho
