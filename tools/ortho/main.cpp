// silvan-ortho: the true-ortho workflow of a master parameter file, end to end.
#include "files.h"
#include "inputs.h"
#include "interrupt.h"
#include "options.h"
#include "progress.h"
#include "steps.h"
#include "workflow.h"

#include <cstdio>
#include <exception>
#include <string>
#include <vector>

namespace {

void PrintScenes(const ortho::RunSummary& summary, const std::string& summaryPath) {
    for (const ortho::SceneSummary& scene : summary.scenes) {
        std::printf("line %-4u %-9s %7.1f s  %s", scene.masterLine, scene.status.c_str(),
                    scene.seconds, scene.source.c_str());
        if (!scene.ortho.empty())
            std::printf(" -> %s", scene.ortho.c_str());
        std::printf("\n");
    }
    if (!summary.mosaic.empty())
        std::printf("mosaic     %s\n", summary.mosaic.c_str());
    if (!summary.footprints.empty())
        std::printf("footprints %s\n", summary.footprints.c_str());
    std::printf("summary    %s\n", summaryPath.c_str());
}

// Parses and checks the command line before any work: the options, what the named files are,
// the values the library interprets. Prints what is wrong and returns 2, or 0 to go on (with
// the lines worth telling the user in notes). --help and --version print and return -1.
int ReadCommandLine(int argc, char** argv, ortho::Options& options,
                    std::vector<std::string>& notes) {
    try {
        options = ortho::ParseOptions(std::vector<std::string>(argv + 1, argv + argc));
        if (options.help) {
            std::fputs(ortho::UsageText().c_str(), stdout);
            return -1;
        }
        if (options.version) {
            std::fputs(ortho::VersionText().c_str(), stdout);
            return -1;
        }
        ortho::ResolveInputs(options);
        notes = ortho::CheckOptions(options);
        if (!options.images.empty())
            ortho::PlanImageMaster(options);
        ortho::CheckModels(options);
        return 0;
    } catch (const ortho::UsageError& e) {
        std::fprintf(stderr, "silvan-ortho: %s\n(silvan-ortho --help shows the usage)\n", e.what());
    } catch (const std::exception& e) {
        std::fprintf(stderr, "silvan-ortho: %s\n", ortho::Explain(e).c_str());
    }
    return 2;
}

}  // namespace

int main(int argc, char** argv) {
    kestrel::gdalsupport::EnsureRegistered();
    ortho::Options options;
    std::vector<std::string> notes;
    const int read = ReadCommandLine(argc, argv, options, notes);
    if (read != 0)
        return read < 0 ? 0 : read;
    try {
        // GDAL's block cache would otherwise take up to 5 % of the memory, filled by every
        // raster a survey reads.
        const ortho::BlockCache cache(ortho::kRunCacheBytes);
        ortho::CatchInterrupts();
        ortho::Progress progress(stderr, ortho::IsTerminal(stderr), options.quiet);
        for (const std::string& note : notes)
            progress.Info(note);
        ortho::Workflow workflow(options, progress);
        const int status = workflow.Run();
        progress.Done();
        // A run refused (another one works on the directory) has nothing to list.
        if (!options.quiet && !workflow.SummaryPath().empty())
            PrintScenes(workflow.Summary(), workflow.SummaryPath());
        return status;
    } catch (const std::exception& e) {
        std::fprintf(stderr, "silvan-ortho: %s\n", ortho::Explain(e).c_str());
        return 1;
    }
}
