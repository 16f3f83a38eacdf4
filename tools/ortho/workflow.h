// The run of silvan-ortho: derived parameter files, the scenes of the preparation file on one
// common grid, scheduled on several threads and resumed where a previous run stopped, then
// occlusion recovery over the image set, and the summary.
#pragma once

#include "options.h"
#include "progress.h"
#include "steps.h"
#include "summary.h"

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
    std::string id;               // the image set's identifier: the base name of the source
    std::string name;             // outputs are named after it
    SceneInput input;
    bool inSlice = true;
    bool inImageSet = false;
    RadiometricDiff radioDif = RadioDifAny;
    int dbmPxErr = 0;

    std::string ortho, visibility, xml, footprint, quicklook;

    std::string error;  // the line cannot be used, or the scene failed
    std::string status;
    double seconds = 0.0;
    bool hasGrid = false;
    Grid grid;  // the scene's own layout
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
    void RunScenes();
    void RunScene(Scene& scene);
    bool IsComplete(const Scene& scene) const;
    void Recover();
    void Finish(bool succeeded);
    void Fail(Scene& scene, const std::string& message);
    std::string Where(const Scene& scene) const;  // "master.txt, line 4"

    const Options& options_;
    Progress& progress_;
    std::string outDir_;
    std::string prepFile_, imgSetFile_, gridFile_;
    std::vector<Scene> scenes_;
    Grid grid_;
    bool stopped_ = false;  // a failure stops the run (no --keep-going)
    RunSummary summary_;
    std::string summaryPath_;
    // Seconds spent in each step, summed over the scenes (threads add to it).
    std::mutex stepMutex_;
    std::vector<std::pair<std::string, double>> stepSeconds_;
    void AddStep(const std::string& step, double seconds);
};

}  // namespace ortho
