// silvan-ortho: the true-ortho workflow of a master parameter file, end to end.
#include "files.h"
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

}  // namespace

int main(int argc, char** argv) {
    ortho::Options options;
    try {
        options = ortho::ParseOptions(std::vector<std::string>(argv + 1, argv + argc));
    } catch (const ortho::UsageError& e) {
        std::fprintf(stderr, "silvan-ortho: %s\n(silvan-ortho --help shows the usage)\n", e.what());
        return 2;
    }
    if (options.help) {
        std::fputs(ortho::UsageText().c_str(), stdout);
        return 0;
    }
    try {
        ortho::CheckOptions(options);
    } catch (const std::exception& e) {
        std::fprintf(stderr, "silvan-ortho: %s\n", ortho::Explain(e).c_str());
        return 2;
    }
    try {
        ortho::CatchInterrupts();
        ortho::Progress progress(stderr, ortho::IsTerminal(stderr), options.quiet);
        ortho::Workflow workflow(options, progress);
        const int status = workflow.Run();
        progress.Done();
        if (!options.quiet)
            PrintScenes(workflow.Summary(), workflow.SummaryPath());
        return status;
    } catch (const std::exception& e) {
        std::fprintf(stderr, "silvan-ortho: %s\n", e.what());
        return 1;
    }
}
