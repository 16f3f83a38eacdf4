// The run's summary for pipelines: summary.json.
#pragma once

#include <string>
#include <utility>
#include <vector>

namespace ortho {

struct SceneSummary {
    int line = 0;                 // data line of the preparation file, from 0 (as --lines counts)
    unsigned int masterLine = 0;  // line of the master file, from 1 (as messages count)
    std::string source;  // source image as the master file names it
    std::string ortho;   // paths as written
    std::string visibility;
    std::string scene;      // the scene description XML
    std::string footprint;  // the scene's footprint file
    std::string status;     // "done", "complete" (found done before), "failed", "cancelled",
                            // "not run"
    double seconds = 0.0;   // time spent on the scene in this run
    std::string error;      // why it failed
    std::string reason;     // why it was made in this run ("--resample changed: ...")
};

struct RunSummary {
    std::string master;
    std::string status;  // "complete", "partial" (a slice), "failed", "cancelled"
    std::vector<SceneSummary> scenes;
    std::string mosaic;        // empty: not made by this run
    std::string mosaicSource;  // which image each mosaic pixel came from: 1 + its index in
    std::vector<std::string> mosaicScenes;  // these scene names, 0 where none sees the pixel
    // The colour of each value in the source raster's quicklook: [0] for 0, [k] for value k.
    std::vector<std::string> mosaicColours;
    std::string mosaicReason;  // why the mosaic was made in this run; empty: kept
    std::string seamlines;  // the mosaic's regions as polygons (seamlines.gpkg)
    // The mosaic's seams, blending and colour balance, as BalanceJson writes them; empty: null.
    std::string balance;
    std::string footprints;
    std::vector<std::string> quicklooks;
    std::vector<std::string> errors;  // failures outside the scenes
    // Seconds per step of the run, in order.
    std::vector<std::pair<std::string, double>> timings;
};

std::string ToJson(const RunSummary& summary);

// The legend of the source raster's quicklook, a JSON array: {"value": 0, "scene": null,
// "colour": "#282828"}, then {"value": k, "scene": scenes[k-1], "colour": colours[k]}.
std::string LegendJson(const std::vector<std::string>& scenes,
                       const std::vector<std::string>& colours);

// How the mosaic was put together: its seamlines, blending and colour balance.
struct MosaicBalance {
    std::string method;  // --balance
    std::string blend;   // --blend
    std::string seams;   // --seams
    unsigned int blendWidth = 0;
    std::string seamlines;  // the --seamlines file; empty: chosen by the recovery
    std::vector<std::string> scenes;
    std::vector<std::vector<double>> gain, offset;  // per scene and channel
};
// One line: {"method": "gain-offset", "blend": "feather", "blend_width": 16, "seams": "lines",
// "seamlines": null,
// "scenes": [{"scene": "north", "gain": [1.02, ...], "offset": [-1.5, ...]}, ...]}; a scene
// for which the recovery reported no balance has empty lists.
std::string BalanceJson(const MosaicBalance& balance);

// A JSON string of any bytes, valid UTF-8: control characters escaped, and each byte that is
// not part of valid UTF-8 written as the lone surrogate \udcXX (Python's "surrogateescape"),
// so that the original bytes of a file name can be had back.
std::string JsonString(const std::string& text);
// The bytes of a JSON string as JsonString writes it, from just after its opening quote at
// `at`; `at` ends after the closing quote. False when there is no whole string there.
bool ReadJsonString(const std::string& text, std::size_t& at, std::string& value);

// Writes the text under a temporary name and renames it over path, so that a reader never sees
// a half-written file. Throws kestrel::FileAccessException naming the path.
void WriteFileAtomically(const std::string& path, const std::string& text);

}  // namespace ortho
