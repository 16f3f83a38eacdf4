// The run of silvan-ortho: derived parameter files, the scenes of the preparation file on one
// common grid, scheduled on several threads and made again only where their inputs or options
// changed, then occlusion recovery over the image set, and the summary.
#pragma once

#include "files.h"
#include "manifest.h"
#include "options.h"
#include "progress.h"
#include "steps.h"
#include "summary.h"

#include <atomic>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

namespace ortho {

// A failure of the run as a whole (not of one scene); the message says what and where.
class RunError : public std::runtime_error {
  public:
    using std::runtime_error::runtime_error;
};

struct Scene {
    int line = 0;                 // data line of the preparation file, from 0
    unsigned int masterLine = 0;  // line of the master file, from 1
    std::string given;            // the source as the master file names it
    std::string columns;          // the line of the preparation file: what the ortho reads
    std::string id;               // the image set's identifier: the base name of the source
    std::string name;             // outputs are named after it
    SceneInput input;
    bool inSlice = true;
    bool inImageSet = false;
    RadiometricDiff radioDif = RadioDifAny;
    int dbmPxErr = 0;

    std::string ortho, visibility, xml, footprint, quicklook, manifest;
    Manifest madeFrom;   // the inputs and options its outputs are made from in this run
    std::string reason;  // why it is made in this run; empty: complete from an earlier run

    std::string error;  // the line cannot be used, or the scene failed
    std::string status;
    double seconds = 0.0;
    bool hasGrid = false;
    Grid grid;  // the scene's own layout
    // The scene's window of the common grid, on which its ortho and visibility index lie.
    bool hasWindow = false;
    Grid window;
};

class Workflow {
  public:
    Workflow(const Options& options, Progress& progress);
    // Runs everything asked for; the exit status: 0 when all was done, 1 otherwise.
    int Run();

    const RunSummary& Summary() const { return summary_; }
    // Where the summary was written; empty before the run.
    const std::string& SummaryPath() const { return summaryPath_; }

  private:
    void Prepare();
    void MakeGrid();
    // The common grid and the scenes' windows from grid.txt when it was worked out from these
    // inputs; false when it must be worked out again.
    bool UseStoredGrid(const std::string& key);
    // The warning line of a scene whose image's ground the surface covers only in part.
    void WarnUncovered(const Scene& scene, double share);
    void RunScenes();
    // Refuses a run in which an output, or its temporary file, would be written over an input
    // or over another output. `sources`: the source of each master line, as given.
    void CheckOutputsSpareInputs(const std::vector<std::string>& sources);
    // Every output of the run that is not a scene's, and what it is.
    std::vector<std::pair<std::string, std::string>> RunOutputs() const;
    std::string SummaryName() const;
    Manifest GridInputs();
    void RecordInputs(Scene& scene);
    void RecordCamera(const Scene& scene, Manifest& inputs);
    // Why the scene is to be made in this run; empty when its outputs are complete and made
    // from the inputs and options of this run.
    std::string WhyMake(const Scene& scene) const;
    void RunScene(Scene& scene);
    void Recover();
    void Finish(bool succeeded);
    void Fail(Scene& scene, const std::string& message);
    std::string Where(const Scene& scene) const;  // "master.txt, line 4"
    const FileIdentity& Identity(const std::string& path);
    const std::vector<std::string>& FilesOf(const std::string& dataset);

    const Options& options_;
    Progress& progress_;
    std::string outDir_;
    std::string prepFile_, imgSetFile_, gridFile_;
    std::vector<Scene> scenes_;
    std::vector<unsigned int> masterLines_;  // line of the master file of each data line
    Grid grid_;
    std::atomic<bool> stopped_{false};  // a failure stops the run (no --keep-going)
    std::unique_ptr<RunLock> lock_;
    bool refused_ = false;  // another run holds the directory: leave its summary alone
    // Identities and file lists of the inputs, each worked out once before the scenes start.
    std::map<std::string, FileIdentity> identities_;
    std::map<std::string, std::vector<std::string>> files_;
    RunSummary summary_;
    std::string summaryPath_;
    // Seconds spent in each step, summed over the scenes (threads add to it).
    std::mutex stepMutex_;
    std::vector<std::pair<std::string, double>> stepSeconds_;
    void AddStep(const std::string& step, double seconds);
};

}  // namespace ortho
