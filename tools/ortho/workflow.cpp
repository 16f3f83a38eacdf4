#include "workflow.h"

#include "files.h"
#include "inputs.h"
#include "interrupt.h"
#include "seamlines.h"

#include <silvan/parserfactory.h>
#include <silvan/tomfileparser.h>
#include <silvan/tosceneparser.h>
#include <silvan/tpmfileparser.h>

#include <kestrel/file.h>
#include <kestrel/formats.h>

#include <algorithm>
#include <cctype>
#include <atomic>
#include <chrono>
#include <cmath>
#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <limits>
#include <map>
#include <mutex>
#include <set>
#include <sstream>
#include <stdexcept>
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

// The status of a scene whose layout does not reach --te.
const char* const kOutsideArea = "outside the area of interest";

// A scene's window on the common grid, as grid.txt keeps it: its data line, its top left cell
// in the common grid, its size, and the share of its image's ground the surface leaves out.
struct WindowRecord {
    int line = 0;
    long long column = 0, row = 0;
    unsigned int pixels = 0, lines = 0;
    double uncoveredShare = 0.0;
};

// The common grid, the data lines of the scenes outside the area of interest (when any) and the
// other scenes' windows.
std::string GridText(const std::string& key, const Grid& grid,
                     const std::vector<int>& outside = {},
                     const std::vector<WindowRecord>& windows = {}) {
    std::ostringstream out;
    out.precision(17);
    out << key << '\n' << grid.pixels << ' ' << grid.lines << '\n';
    for (const double g : grid.geoTransform)
        out << g << ' ';
    out << '\n' << grid.crs << '\n';
    if (!outside.empty()) {
        out << "outside";
        for (const int line : outside)
            out << ' ' << line;
        out << '\n';
    }
    for (const WindowRecord& w : windows)
        out << "window " << w.line << ' ' << w.column << ' ' << w.row << ' ' << w.pixels << ' '
            << w.lines << ' ' << w.uncoveredShare << '\n';
    return out.str();
}

bool ReadGridText(const std::string& path, const std::string& key, Grid& grid,
                  std::vector<int>& outside, std::vector<WindowRecord>& windows) {
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
    std::vector<int> lines;
    std::vector<WindowRecord> records;
    for (std::string text; std::getline(in, text);) {
        std::istringstream words(text);
        std::string word;
        if (!(words >> word))
            continue;
        if (word == "outside") {
            for (int line = 0; words >> line;)
                lines.push_back(line);
        } else if (word == "window") {
            WindowRecord w;
            if (!(words >> w.line >> w.column >> w.row >> w.pixels >> w.lines >> w.uncoveredShare))
                return false;
            records.push_back(w);
        } else {
            return false;
        }
        if (!words.eof())
            return false;
    }
    grid = read;
    outside = lines;
    windows = records;
    return true;
}

// Scene descriptions go through the XML library one at a time: the DTD beside them is written
// by whichever scene finds it missing.
std::mutex& SceneFileMutex() {
    static std::mutex mutex;
    return mutex;
}

// The run was interrupted (Ctrl-C): it unwinds, cleaning up, to a summary saying so.
class Cancelled : public std::runtime_error {
  public:
    Cancelled() : std::runtime_error("interrupted") {}
};

void ThrowIfInterrupted() {
    if (Interrupted())
        throw Cancelled();
}

// An output file and what it is, for messages.
struct Output {
    std::string path;
    std::string what;
};

// The extension of the rasters of a file type: its GDAL driver's (tif for tif and cog), or the
// type itself when the driver names none.
std::string RasterExtension(const std::string& type) {
    try {
        const std::string ext = kestrel::core::FileExtension(kestrel::core::FType2FormatName(type));
        if (!ext.empty())
            return ext;
    } catch (const std::exception&) {
        // An unknown type is refused by the option checks; its name stays as given.
    }
    return type;
}

// The quicklook of the raster dir/stem.EXT: dir/stem.png, or dir/stem_quicklook.png when the
// rasters are PNG files themselves, so that it does not replace the raster.
std::string QuicklookName(const std::string& dir, const std::string& stem,
                          const std::string& ext) {
    return Join(dir, stem + (Lower(ext) == "png" ? "_quicklook.png" : ".png"));
}

// The outputs of a scene named `name`, in the order of Scene's fields.
std::vector<Output> SceneOutputs(const std::string& dir, const std::string& name,
                                 const std::string& type) {
    const std::string format = RasterExtension(type);
    const std::string classes = RasterExtension(ClassRasterType(type));
    return {{Join(dir, name + "_ortho." + format), "the ortho"},
            {Join(dir, name + "_vis." + classes), "the visibility index"},
            {Join(dir, name + ".xml"), "the scene description"},
            {Join(dir, name + "_footprint.gpkg"), "the footprint"},
            {QuicklookName(dir, name + "_vis", classes), "the visibility quicklook"},
            {Join(dir, name + "_manifest.json"), "the record of inputs"}};
}

// What two paths are compared by: the same file however it is named (links, "..", and the
// letter case on file systems that ignore it).
std::string SameFileKey(const std::string& path) {
    std::error_code ec;
    fs::path key = fs::weakly_canonical(fs::absolute(path, ec), ec);
    if (ec)
        key = fs::absolute(path, ec);
    std::string text = key.lexically_normal().string();
#if defined(_WIN32) || defined(__APPLE__)
    text = Lower(text);
#endif
    return text;
}

// The program and the libraries that made an output: a new version may make other pixels.
std::string ProgramVersion() {
    std::string text = VersionText();
    while (!text.empty() && (text.back() == '\n' || text.back() == '\r'))
        text.pop_back();
    return text;
}

std::string SurfacePath(const Options& options) {
    return options.dem.empty() ? options.tin : options.dem;
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

const FileIdentity& Workflow::Identity(const std::string& path) {
    auto known = identities_.find(path);
    if (known == identities_.end()) {
        ThrowIfInterrupted();
        known = identities_.emplace(path, IdentifyFile(path)).first;
    }
    return known->second;
}

const std::vector<std::string>& Workflow::FilesOf(const std::string& dataset) {
    auto known = files_.find(dataset);
    if (known == files_.end())
        known = files_.emplace(dataset, DatasetFiles(dataset)).first;
    return known->second;
}

std::string Workflow::SummaryName() const {
    if (!options_.hasLines)
        return "summary.json";
    return "summary-" + std::to_string(options_.firstLine) + "-" +
           (options_.endLine == std::numeric_limits<unsigned int>::max()
                ? std::string("end")
                : std::to_string(options_.endLine)) +
           ".json";
}

int Workflow::Run() {
    summary_.master = options_.master;
    const auto start = Clock::now();
    bool succeeded = false;
    try {
        auto step = Clock::now();
        Prepare();
        if (!options_.seamlines.empty()) {
            std::vector<std::string> names;
            for (const Scene& scene : scenes_)
                names.push_back(scene.name);
            CheckSeamlineScenes(options_.seamlines, names);
        }
        summary_.timings.emplace_back("prepare", SecondsSince(step));
        const bool anyScene =
            std::any_of(scenes_.begin(), scenes_.end(), [](const Scene& s) { return s.inSlice; });
        if (!anyScene && !options_.hasLines) {
            stopped_ = true;
            summary_.errors.push_back(options_.master + ": no data line names a scene");
        }
        step = Clock::now();
        if (anyScene)
            MakeGrid();
        if (anyScene && !stopped_) {
            const std::string holes = SurfaceHoles(options_, grid_);
            if (!holes.empty())
                progress_.Info(holes);
        }
        summary_.timings.emplace_back("grid", SecondsSince(step));
        step = Clock::now();
        if (!stopped_ && anyScene)
            RunScenes();
        summary_.timings.emplace_back("scenes", SecondsSince(step));
        step = Clock::now();
        if (!stopped_ && anyScene && !options_.hasLines && !Interrupted())
            Recover();
        summary_.timings.emplace_back("recovery", SecondsSince(step));
        succeeded = !stopped_ && summary_.errors.empty();
        for (const Scene& scene : scenes_) {
            if (scene.inSlice && scene.status != "done" && scene.status != "complete" &&
                scene.status != kOutsideArea)
                succeeded = false;
        }
    } catch (const Cancelled&) {
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
    if (Interrupted())
        progress_.Error("interrupted: the run stopped; run it again to finish");
    Finish(succeeded && !Interrupted());
    return Interrupted() ? kInterruptedStatus : succeeded ? 0 : 1;
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

    // One run at a time on a directory; the slices of one run side by side.
    try {
        lock_ = std::make_unique<RunLock>(
            outDir_, options_.hasLines,
            "process " + std::to_string(ProcessId()) +
                (options_.hasLines
                     ? " (--lines " + std::to_string(options_.firstLine) + ":" +
                           (options_.endLine == std::numeric_limits<unsigned int>::max()
                                ? std::string()
                                : std::to_string(options_.endLine)) +
                           ")"
                     : std::string()));
    } catch (const std::runtime_error& e) {
        refused_ = true;
        throw RunError(e.what());
    }
    // Images given instead of a master file: their master file, written under the lock.
    if (!options_.images.empty())
        WriteImageMaster(options_);

    // The master file gives the two derived files; the process reads them back as the
    // preparation and gap-filling processes would.
    std::unique_ptr<TOMFileParser> master;
    try {
        master.reset(ParserFactory::CreateTOMFileParser(options_.master));
    } catch (const kestrel::Exception& e) {
        throw RunError(About(options_.master, Explain(e)));
    }
    // The source of each line: its first column, blanks trimmed, as the table reads it.
    std::vector<std::string> sources;
    for (const auto& line : DataLines(options_.master)) {
        masterLines_.push_back(line.first);
        sources.push_back(LineColumns(line.second)[0]);
    }
    CheckOutputsSpareInputs(sources);
    try {
        DeriveFile(prepFile_, [&](const std::string& part) { master->WriteMFilePrep(part); });
        DeriveFile(imgSetFile_, [&](const std::string& part) { master->WriteImgSet(part); });
    } catch (const kestrel::Exception& e) {
        throw RunError(About(options_.master, Explain(e)));
    }
    const std::vector<std::pair<unsigned int, std::string>> prepLines = DataLines(prepFile_);
    const fs::path masterDir = fs::absolute(options_.master, ec).parent_path();

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
    std::map<std::string, int> names;
    for (unsigned int i = 0; i < count; ++i) {
        Scene scene;
        scene.line = static_cast<int>(i);
        scene.masterLine = i < masterLines_.size() ? masterLines_[i] : i + 1;
        if (i < prepLines.size())
            scene.columns = prepLines[i].second;
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
            scene.input.source = ResolveSource(scene.given, masterDir);
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
            const std::vector<Output> outputs = SceneOutputs(outDir_, scene.name, options_.format);
            scene.ortho = outputs[0].path;
            scene.visibility = outputs[1].path;
            scene.xml = outputs[2].path;
            scene.footprint = outputs[3].path;
            scene.quicklook = outputs[4].path;
            scene.manifest = outputs[5].path;
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


std::vector<std::pair<std::string, std::string>> Workflow::RunOutputs() const {
    const std::string f = RasterExtension(options_.format);
    const std::string c = RasterExtension(ClassRasterType(options_.format));
    std::vector<std::pair<std::string, std::string>> outputs = {
            {prepFile_, "the preparation file"},
            {imgSetFile_, "the image-set file"},
            {gridFile_, "the common grid"},
            {Join(outDir_, "summary.json"), "the summary"},
            {Join(outDir_, RunLock::FileName()), "the run's lock"},
            {Join(outDir_, "TOSceneDesc_Document.dtd"), "the scene descriptions' DTD"},
            {Join(outDir_, "footprints.gpkg"), "the footprints"},
            {Join(outDir_, "mosaic." + f), "the mosaic"},
            {Join(outDir_, "mosaic_source." + c), "the mosaic's source raster"},
            {QuicklookName(outDir_, "mosaic", f), "the mosaic's quicklook"},
            {QuicklookName(outDir_, "mosaic_source", c), "the source raster's quicklook"},
            {Join(outDir_, "mosaic_source_legend.json"), "the source quicklook's legend"},
            {Join(outDir_, "seamlines.gpkg"), "the mosaic's seamlines"},
            {Join(outDir_, "mosaic_manifest.json"), "the mosaic's record of inputs"}};
    if (options_.hasLines)
        outputs.emplace_back(Join(outDir_, SummaryName()), "the slice's summary");
    return outputs;
}

void Workflow::CheckOutputsSpareInputs(const std::vector<std::string>& sources) {
    // Every file the run reads, and what it is.
    std::map<std::string, std::string> inputs;
    const auto read = [&](const std::string& path, const std::string& what) {
        inputs.emplace(SameFileKey(path), what + " " + path);
    };
    read(options_.master, "the master file");
    for (const std::string& file : FilesOf(SurfacePath(options_)))
        read(file, "the surface model");
    if (!options_.cutline.empty())
        read(options_.cutline, "the cutline");
    // Each run writes DIR/seamlines.gpkg anew: an edited one is handed back as a copy.
    if (!options_.seamlines.empty())
        read(options_.seamlines, "the --seamlines layer (hand back an edited copy of "
                                 "seamlines.gpkg, which each run writes anew)");
    if (!options_.dtm.empty()) {
        for (const std::string& file : FilesOf(options_.dtm))
            read(file, "the ground model");
    }
    std::vector<std::pair<std::string, std::string>> outputs = RunOutputs();
    std::set<std::string> names;
    const fs::path masterDir = fs::absolute(options_.master).parent_path();
    for (std::size_t i = 0; i < sources.size(); ++i) {
        if (sources[i].empty())
            continue;
        const std::string where =
            options_.master + ", line " +
            std::to_string(i < masterLines_.size() ? masterLines_[i] : i + 1);
        const std::string source = ResolveSource(sources[i], masterDir);
        for (const std::string& file : FilesOf(source))
            read(file, (file == source ? "the source image of " : "a side file of the source of ") +
                           where + ":");
        // A name taken twice fails on its own line.
        const std::string name =
            fs::path(kestrel::core::fileio::File(sources[i]).GetBasename()).stem().string();
        if (name.empty() || !names.insert(name).second)
            continue;
        for (const Output& output : SceneOutputs(outDir_, name, options_.format))
            outputs.emplace_back(output.path, output.what + " of " + where);
    }
    // No output over an input, no two outputs (final or temporary) on one file.
    std::map<std::string, std::string> written;
    for (const auto& output : outputs) {
        for (const bool part : {false, true}) {
            const std::string path = part ? PartName(output.first) : output.first;
            const std::string what = part ? "the temporary file of " + output.second : output.second;
            const std::string key = SameFileKey(path);
            const auto input = inputs.find(key);
            if (input != inputs.end())
                throw RunError(path + ": " + what + " would be written over " + input->second +
                               "; choose another --out");
            const auto other = written.emplace(key, what);
            if (!other.second)
                throw RunError(path + ": both " + other.first->second + " and " + what +
                               " would be written there");
        }
    }
}

Manifest Workflow::GridInputs() {
    // The scenes' layouts depend on the surface, the options that move footprints and every
    // line's source and columns, including those of other slices.
    Manifest inputs;
    inputs.Set("program", ProgramVersion());
    for (const PixelOption& option : PixelOptions()) {
        if (option.movesFootprints)
            inputs.Set(option.name, option.value(options_));
    }
    for (const std::string& file : FilesOf(SurfacePath(options_)))
        inputs.SetFile("surface file", file, Identity(file));
    // The cutline says which scenes are outside the area of interest.
    if (!options_.cutline.empty())
        inputs.SetFile("cutline file", options_.cutline, Identity(options_.cutline));
    for (const Scene& scene : scenes_) {
        if (!scene.error.empty())
            continue;
        inputs.Set(Where(scene), scene.columns);
        for (const std::string& file : FilesOf(scene.input.source))
            inputs.SetFile("source file", file, Identity(file));
        RecordCamera(scene, inputs);
    }
    return inputs;
}

void Workflow::WarnUncovered(const Scene& scene, double share) {
    if (share <= 0.0)
        return;
    char text[32];
    std::snprintf(text, sizeof text, "%.1f %%", 100.0 * share);
    progress_.Info("warning: " + scene.name + ": the surface model leaves out " + text +
                   " of the image's ground; the ortho covers the rest");
}

bool Workflow::UseStoredGrid(const std::string& key) {
    std::vector<int> outside;
    std::vector<WindowRecord> windows;
    if (options_.overwrite || !ReadGridText(gridFile_, key, grid_, outside, windows))
        return false;
    // Every usable scene is outside the area or has its window, else the layouts are made again.
    std::map<int, const WindowRecord*> byLine;
    for (const WindowRecord& w : windows)
        byLine[w.line] = &w;
    for (const Scene& scene : scenes_) {
        const bool isOutside =
            std::find(outside.begin(), outside.end(), scene.line) != outside.end();
        const auto w = byLine.find(scene.line);
        if (scene.error.empty() && !isOutside &&
            (w == byLine.end() || w->second->pixels == 0 || w->second->lines == 0 ||
             w->second->column < 0 || w->second->row < 0 ||
             w->second->column + w->second->pixels > grid_.pixels ||
             w->second->row + w->second->lines > grid_.lines))
            return false;
    }
    for (Scene& scene : scenes_) {
        if (std::find(outside.begin(), outside.end(), scene.line) != outside.end()) {
            scene.status = kOutsideArea;
            continue;
        }
        const auto w = byLine.find(scene.line);
        if (!scene.error.empty() || w == byLine.end())
            continue;
        const WindowRecord& r = *w->second;
        scene.window = WindowAt(grid_, r.column, r.row, r.pixels, r.lines);
        scene.hasWindow = true;
        if (scene.inSlice)
            WarnUncovered(scene, r.uncoveredShare);
    }
    return true;
}

void Workflow::MakeGrid() {
    const std::string key = GridInputs().Fingerprint();
    if (UseStoredGrid(key))
        return;

    // The first scene whose layout can be made fixes the CRS and pixel size of all others.
    std::string crs = options_.srs;
    double pixelWidth = options_.xRes > 0.0 ? options_.xRes : options_.pixelSize;
    double pixelHeight = options_.yRes > 0.0 ? options_.yRes : options_.pixelSize;
    const bool sizeGiven = pixelWidth > 0.0;
    Area area{};
    std::unique_ptr<AreaOfInterest> aoi;
    const bool limited = options_.hasExtent || !options_.cutline.empty();
    bool fixed = false;
    std::map<int, Footprint> footprints;
    const auto layout = [&](Scene& scene) {
        try {
            Footprint footprint;
            scene.grid = SceneLayout(options_, scene.input, crs, pixelWidth, pixelHeight,
                                     &footprint, true);
            scene.hasGrid = true;
            footprints[scene.line] = std::move(footprint);
            return true;
        } catch (const std::exception& e) {
            scene.hasGrid = false;
            scene.error = Where(scene) + ": " + Explain(e);
            if (scene.inSlice) {
                progress_.Error(scene.error);
                Fail(scene, scene.error);
            }
            return false;
        }
    };
    std::vector<Grid> grids;
    std::vector<int> outside;
    for (Scene& scene : scenes_) {
        if (!scene.error.empty() || stopped_)
            continue;
        ThrowIfInterrupted();
        if (!layout(scene))
            continue;
        if (!fixed) {
            fixed = true;
            crs = scene.grid.crs;
            pixelWidth = scene.grid.geoTransform[1];
            pixelHeight = -scene.grid.geoTransform[5];
            try {
                if (options_.hasExtent)
                    area = AreaInCrs(options_, crs);
                if (limited)
                    aoi = std::make_unique<AreaOfInterest>(
                        options_, crs, options_.hasExtent ? &area : nullptr);
            } catch (const std::exception& e) {
                throw RunError(Explain(e));
            }
            // --te without a pixel size, as gdalwarp -te: the area exactly, in whole cells of
            // about the source's resolution.
            if (options_.hasExtent && !sizeGiven) {
                const double columns = WholeCells(area[2] - area[0], pixelWidth);
                const double rows = WholeCells(area[3] - area[1], pixelHeight);
                if (columns >= 1 && rows >= 1) {
                    pixelWidth = (area[2] - area[0]) / columns;
                    pixelHeight = (area[3] - area[1]) / rows;
                    if (!layout(scene))
                        continue;
                }
            }
        }
        const auto footprint = footprints.find(scene.line);
        if (aoi && footprint->second && !aoi->Reaches(*footprint->second)) {
            scene.status = kOutsideArea;
            outside.push_back(scene.line);
            continue;
        }
        grids.push_back(scene.grid);
    }
    if (stopped_)
        return;
    if (grids.empty() && !outside.empty())
        throw RunError("no scene reaches the area of interest of --te or --cutline");
    if (grids.empty())
        throw RunError(options_.master + ": no scene has a usable layout");
    grid_ = CommonGrid(grids, options_.hasExtent ? &area : nullptr);

    // Each scene's window of the common grid; one whose footprint covers no cell of it is
    // outside the area.
    std::vector<WindowRecord> windows;
    for (Scene& scene : scenes_) {
        if (!scene.hasGrid || scene.status == kOutsideArea)
            continue;
        const Footprint& footprint = footprints[scene.line];
        if (!footprint || footprint->numPoints < 3) {
            scene.window = grid_;  // the scene fails on its footprint when it runs
        } else if (!SceneWindow(grid_, *footprint, scene.window)) {
            scene.status = kOutsideArea;
            outside.push_back(scene.line);
            continue;
        }
        scene.hasWindow = true;
        const auto cell = CellOffset(grid_, scene.window);
        windows.push_back({scene.line, cell[0], cell[1], scene.window.pixels, scene.window.lines,
                           scene.grid.uncoveredShare});
        if (scene.inSlice)
            WarnUncovered(scene, scene.grid.uncoveredShare);
    }
    WriteFileAtomically(gridFile_, GridText(key, grid_, outside, windows));
    progress_.Info("common grid: " + grid_.Describe());
    if (!outside.empty())
        progress_.Info(std::to_string(outside.size()) +
                       " scene(s) outside the area of interest are skipped");
}

void Workflow::RecordInputs(Scene& scene) {
    Manifest& made = scene.madeFrom;
    made.Set("master line", scene.columns);
    made.Set("program", ProgramVersion());
    // The area of interest changes a scene's pixels only through its window.
    for (const PixelOption& option : PixelOptions()) {
        if (std::string(option.name) != "--te")
            made.Set(option.name, option.value(options_));
    }
    made.Set("window", scene.window.Describe() + " (" +
                           Fingerprint(GridText("", scene.window)) + ")");
    for (const std::string& file : FilesOf(scene.input.source))
        made.SetFile("source file", file, Identity(file));
    for (const std::string& file : FilesOf(SurfacePath(options_)))
        made.SetFile("surface file", file, Identity(file));
    RecordCamera(scene, made);
}

void Workflow::RecordCamera(const Scene& scene, Manifest& inputs) {
    // The file of the scene's camera, when it has one: --cameras, or its side file.
    const std::string camera = options_.cameras.empty()
                                   ? kestrel::mathmodel::CameraSideFile(scene.input.source)
                                   : options_.cameras;
    if (FileExists(camera))
        inputs.SetFile("camera file", camera, Identity(camera));
}

std::string Workflow::WhyMake(const Scene& scene) const {
    if (options_.overwrite)
        return "--overwrite";
    Manifest earlier;
    if (!earlier.Read(scene.manifest))
        return FileExists(scene.xml) ? "no record of the inputs it was made from"
                                     : "not made before";
    const std::vector<std::string> changes = scene.madeFrom.ChangesSince(earlier);
    if (!changes.empty())
        return Reason(changes);
    for (const std::string& output :
         {scene.ortho, scene.visibility, scene.xml, scene.footprint, scene.quicklook}) {
        if (!FileExists(output))
            return output + " is missing";
    }
    // A description that names other files (the directory was moved) is made again.
    try {
        std::unique_ptr<TOSceneParser> description;
        {
            std::lock_guard<std::mutex> lock(SceneFileMutex());
            description.reset(ParserFactory::CreateSceneParser(scene.xml));
        }
        if (description->GetOrthoFilename() != scene.ortho ||
            description->GetVisIdxFilename() != scene.visibility ||
            description->GetSceneFilename() != scene.input.source)
            return scene.xml + " names other files";
    } catch (const std::exception& e) {
        return scene.xml + " cannot be read: " + Explain(e);
    }
    Grid ortho, visibility;
    if (!ReadGrid(scene.ortho, ortho) || !ortho.SameAs(scene.window))
        return scene.ortho + " is not whole on the scene's window";
    if (!ReadGrid(scene.visibility, visibility) || !visibility.SameAs(scene.window))
        return scene.visibility + " is not whole on the scene's window";
    return "";
}

void Workflow::RunScenes() {
    std::vector<Scene*> queue;
    for (Scene& scene : scenes_) {
        if (!scene.inSlice || !scene.error.empty() || scene.status == kOutsideArea)
            continue;
        if (!scene.hasWindow) {
            Fail(scene, Where(scene) + ": the scene has no window on the common grid");
            continue;
        }
        RecordInputs(scene);
        scene.reason = WhyMake(scene);
        if (scene.reason.empty()) {
            scene.status = "complete";
            continue;
        }
        if (scene.reason != "not made before")
            progress_.Info(Where(scene) + " (" + scene.name + "): made again: " + scene.reason);
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
                if (stop || Interrupted()) {
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
    // Step weights for the scene's progress; an interrupt stops the generator within a tile.
    const auto report = [&](double from, double to, const std::string& step) {
        return [this, label, from, to, step](double fraction) {
            progress_.Update(label, from + (to - from) * fraction, step);
            return !Interrupted();
        };
    };
    const std::vector<std::string> parts = {PartName(scene.ortho), PartName(scene.visibility),
                                            PartName(scene.quicklook), PartName(scene.xml)};
    try {
        // Outputs of an earlier attempt are made again from the start; the record of inputs
        // goes first, so that no crash leaves it beside outputs it did not make.
        for (const std::string& path : {scene.manifest, scene.xml, scene.ortho, scene.visibility,
                                         scene.footprint, scene.quicklook})
            RemoveFile(path);
        for (const std::string& part : parts)
            RemoveFile(part);

        auto step = Clock::now();
        const auto timed = [&](const char* name) {
            AddStep(name, SecondsSince(step));
            step = Clock::now();
            ThrowIfInterrupted();
        };
        report(0.0, 0.05, "layout")(0.0);
        Footprint footprint;
        SceneLayout(options_, scene.input, grid_.crs, grid_.geoTransform[1],
                    -grid_.geoTransform[5], &footprint, false);
        // The footprint file and the merge take polygons of at least 4 corners.
        if (!footprint || footprint->numPoints < 4)
            KESTREL_THROW(kestrel::DataException,
                          scene.input.source + ": the footprint has " +
                              std::to_string(footprint ? footprint->numPoints : 0) +
                              " corner(s); a scene's footprint needs at least 4");
        timed("scene layout");

        const OrthoResult result =
            MakeOrtho(options_, scene.input, scene.window, parts[0], parts[1],
                      report(0.05, 0.9, "ortho"));
        Publish(parts[0], scene.ortho);
        Publish(parts[1], scene.visibility);
        timed("scene ortho");

        // The footprint layer is labelled with its file's name, so it is written in place; the
        // record of inputs written last says that it is whole.
        report(0.9, 0.95, "footprint")(0.0);
        WriteFootprint(scene.footprint, *footprint);
        timed("scene footprint");
        WriteQuicklook(scene.visibility, parts[2], Quicklook::Visibility);
        Publish(parts[2], scene.quicklook);
        timed("scene quicklook");

        report(0.95, 1.0, "scene")(0.0);
        {
            std::lock_guard<std::mutex> lock(SceneFileMutex());
            std::unique_ptr<TOSceneParser> description(ParserFactory::CreateSceneParser(parts[3]));
            description->SetSceneFilename(scene.input.source);
            description->SetOrthoFilename(scene.ortho);
            description->SetVisIdxFilename(scene.visibility);
            description->SetElevMapFilename(SurfacePath(options_));
            description->SetMmseg(scene.input.mmseg);
            description->SetOrthoNoDataValue(static_cast<float>(result.orthoNoData));
            description->SetElevNoDataValue(static_cast<float>(result.elevationNoData));
            description->SetSceneFootprint(footprint.get());
            description->Serialize(false);
        }
        Publish(parts[3], scene.xml);
        // The record of inputs comes last: its presence says the scene is complete.
        WriteFileAtomically(scene.manifest, scene.madeFrom.ToJson(scene.name));
        timed("scene description");
        scene.status = "done";
    } catch (const std::exception& e) {
        for (const std::string& part : parts)
            RemoveFile(part);
        RemoveFile(scene.footprint);
        if (Interrupted())
            scene.status = "cancelled";
        else
            Fail(scene, Where(scene) + ": " + Explain(e));
    }
    scene.seconds = SecondsSince(start);
    progress_.End(label, scene.status == "done", scene.seconds,
                  scene.status == "cancelled" ? "cancelled" : scene.error);
}

void Workflow::Recover() {
    const std::string ext = RasterExtension(options_.format);
    const std::string classes = RasterExtension(ClassRasterType(options_.format));
    const std::string mosaic = Join(outDir_, "mosaic." + ext);
    const std::string source = Join(outDir_, "mosaic_source." + classes);
    const std::string footprints = Join(outDir_, "footprints.gpkg");
    const std::string record = Join(outDir_, "mosaic_manifest.json");
    const std::vector<std::string> quicklooks = {QuicklookName(outDir_, "mosaic", ext),
                                                 QuicklookName(outDir_, "mosaic_source", classes)};
    const std::string legend = Join(outDir_, "mosaic_source_legend.json");
    const std::string seamlines = Join(outDir_, "seamlines.gpkg");

    // The mosaic is made from the scenes' outputs, so from what made them, and from the
    // image set's values and the options.
    std::vector<RecoveryScene> inputs;
    std::vector<std::string> mosaicScenes;
    std::vector<FootprintLayer> layers;
    Manifest made;
    made.Set("program", ProgramVersion());
    for (const PixelOption& option : PixelOptions())
        made.Set(option.name, option.value(options_));
    const std::string commonGrid =
        grid_.Describe() + " (" + Fingerprint(GridText("", grid_)) + ")";
    made.Set("common grid", commonGrid);
    // What footprints.gpkg is merged from: the scenes' footprints alone, so that a rerun that
    // makes the mosaic again for its own options (or a missing mosaic) keeps it.
    Manifest merged;
    merged.Set("program", ProgramVersion());
    merged.Set("common grid", commonGrid);
    // Cutline, seamlines, ground, blending and balance change the mosaic alone, not the scenes.
    for (const PixelOption& option : MosaicOptions())
        made.Set(option.name, option.value(options_));
    if (!options_.cutline.empty())
        made.SetFile("cutline file", options_.cutline, Identity(options_.cutline));
    if (!options_.seamlines.empty())
        made.SetFile("seamlines file", options_.seamlines, Identity(options_.seamlines));
    if (!options_.dtm.empty()) {
        for (const std::string& file : FilesOf(options_.dtm))
            made.SetFile("ground file", file, Identity(file));
    }
    for (const Scene& scene : scenes_) {
        if (scene.status != "done" && scene.status != "complete")
            continue;
        layers.push_back({scene.name, scene.footprint, scene.input.source});
        merged.Set("layer " + scene.name, scene.footprint + " from " + scene.input.source + " (" +
                                              scene.madeFrom.Fingerprint() + ")");
        made.Set("scene " + scene.name,
                 scene.inImageSet ? "fill, radiometric difference " +
                                        std::to_string(static_cast<int>(scene.radioDif)) +
                                        ", DBM pixel error " + std::to_string(scene.dbmPxErr)
                                  : std::string("preparation only"));
        made.Set("outputs of " + scene.name, scene.madeFrom.Fingerprint(), "", false);
        if (!scene.inImageSet)
            continue;
        inputs.push_back({scene.id, scene.input.source, scene.input.mmseg, scene.ortho,
                          scene.visibility, scene.radioDif, scene.dbmPxErr, scene.name,
                          scene.masterLine});
        mosaicScenes.push_back(scene.name);
    }
    // The master file's scenes that are not mosaicked, which an edited layer may still name.
    std::vector<std::string> others;
    for (const Scene& scene : scenes_) {
        if (!scene.name.empty() &&
            std::find(mosaicScenes.begin(), mosaicScenes.end(), scene.name) == mosaicScenes.end())
            others.push_back(scene.name);
    }
    // The source quicklook's colours: value k stands for mosaicScenes[k-1].
    std::vector<std::string> colours;
    for (unsigned int k = 0; k <= mosaicScenes.size(); ++k)
        colours.push_back(SourceColour(k));
    if (layers.empty())
        return;
    // Recorded, not compared: the footprints are merged again only when it changes.
    made.Set("footprints", "merged from the scenes", merged.Fingerprint());

    std::vector<std::string> outputs = {footprints};
    if (!inputs.empty())
        outputs.insert(outputs.end(),
                       {mosaic, source, quicklooks[0], quicklooks[1], legend, seamlines});
    std::string reason;
    Manifest earlier;
    if (options_.overwrite)
        reason = "--overwrite";
    else if (!earlier.Read(record))
        reason = "not made before";
    else
        reason = Reason(made.ChangesSince(earlier));
    for (const std::string& output : outputs) {
        if (reason.empty() && !FileExists(output))
            reason = output + " is missing";
    }
    std::string balance;
    if (reason.empty()) {
        progress_.Info("mosaic and footprints are up to date");
        balance = earlier.Note("--balance");
    } else {
        if (reason != "not made before")
            progress_.Info("mosaic made again: " + reason);
        summary_.mosaicReason = reason;
        RemoveFile(record);
        auto step = Clock::now();
        if (options_.overwrite || earlier.Note("footprints") != merged.Fingerprint() ||
            !FileExists(footprints)) {
            progress_.Info("merging the footprints of " + std::to_string(layers.size()) +
                           " scene(s)");
            MergeFootprints(layers, grid_, PartName(footprints));
            Publish(PartName(footprints), footprints);
            AddStep("footprint merge", SecondsSince(step));
        }
        if (!inputs.empty()) {
            progress_.Info("occlusion recovery over " + std::to_string(inputs.size()) +
                           " scene(s) of the image set");
            progress_.SetTotal(1);
            progress_.Begin("recovery");
            const auto start = Clock::now();
            try {
                const MosaicResult result = RecoverMosaic(
                    options_, inputs, others, grid_, PartName(mosaic), PartName(source),
                    [this](double fraction) {
                        progress_.Update("recovery", fraction, "mosaic");
                        return !Interrupted();
                    });
                for (const std::string& name : result.seamlinesSkipped)
                    progress_.Info("warning: --seamlines: the polygons of scene " + name +
                                   " are left out: it is not mosaicked in this run");
                Publish(PartName(mosaic), mosaic);
                Publish(PartName(source), source);
                AddStep("occlusion recovery", SecondsSince(start));
                step = Clock::now();
                WriteSeamlines(source, inputs, grid_, PartName(seamlines));
                Publish(PartName(seamlines), seamlines);
                AddStep("seamlines", SecondsSince(step));
                MosaicBalance applied;
                applied.method = options_.balance;
                applied.blend = options_.blend;
                applied.blendWidth = BlendWidth(options_);
                applied.seams = options_.seams;
                applied.seamlines = options_.seamlines;
                applied.scenes = mosaicScenes;
                applied.gain = result.gain;
                applied.offset = result.offset;
                balance = BalanceJson(applied);
                // Recorded, not compared: what a rerun that keeps the mosaic reports.
                made.Set("--balance", options_.balance, balance);
                step = Clock::now();
                WriteQuicklook(mosaic, PartName(quicklooks[0]), Quicklook::Image);
                Publish(PartName(quicklooks[0]), quicklooks[0]);
                WriteQuicklook(source, PartName(quicklooks[1]), Quicklook::SourceIndex);
                Publish(PartName(quicklooks[1]), quicklooks[1]);
                WriteFileAtomically(legend, LegendJson(mosaicScenes, colours) + "\n");
                AddStep("mosaic quicklooks", SecondsSince(step));
                ThrowIfInterrupted();
            } catch (const std::exception& e) {
                for (const std::string& path :
                     {mosaic, source, quicklooks[0], quicklooks[1], seamlines})
                    RemoveFile(PartName(path));
                progress_.End("recovery", false, SecondsSince(start), Explain(e));
                ThrowIfInterrupted();
                throw RunError(imgSetFile_ + ": occlusion recovery: " + Explain(e));
            }
            progress_.End("recovery", true, SecondsSince(start), "");
        }
        WriteFileAtomically(record, made.ToJson("mosaic"));
    }
    summary_.footprints = footprints;
    if (!inputs.empty()) {
        summary_.mosaic = mosaic;
        summary_.mosaicSource = source;
        summary_.mosaicScenes = mosaicScenes;
        summary_.mosaicColours = colours;
        summary_.quicklooks = quicklooks;
        summary_.seamlines = seamlines;
        summary_.balance = balance;
    }
}

void Workflow::Finish(bool succeeded) {
    // Another run owns the directory and its summary.
    if (refused_)
        return;
    summary_.status = Interrupted() ? "cancelled"
                      : !succeeded  ? "failed"
                      : options_.hasLines ? "partial"
                                          : "complete";
    for (const Scene& scene : scenes_) {
        if (!scene.inSlice)
            continue;
        SceneSummary s;
        s.line = scene.line;
        s.masterLine = scene.masterLine;
        s.source = scene.given;
        s.status = scene.status.empty() ? "not run" : scene.status;
        s.seconds = scene.seconds;
        s.error = scene.error;
        if (s.status != "complete")
            s.reason = scene.reason;
        if (s.status == "done" || s.status == "complete") {
            s.ortho = scene.ortho;
            s.visibility = scene.visibility;
            s.scene = scene.xml;
            s.footprint = scene.footprint;
            summary_.quicklooks.push_back(scene.quicklook);
        }
        // A failed run lists every failure in `errors` too.
        if (!scene.error.empty())
            summary_.errors.push_back(scene.error);
        summary_.scenes.push_back(s);
    }
    if (summary_.status == "failed" && summary_.errors.empty())
        summary_.errors.push_back("the run stopped before every scene was made");
    if (outDir_.empty())
        return;
    try {
        WriteFileAtomically(Join(outDir_, SummaryName()), ToJson(summary_));
        summaryPath_ = Join(outDir_, SummaryName());
    } catch (const std::exception& e) {
        progress_.Error(Explain(e));
    }
}

}  // namespace ortho
