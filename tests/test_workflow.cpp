// The workflow command, run as a user runs it: command line, derived files, errors that name
// the master line, summary. With the sample builder and the whole chain, the workflow end to end
// on a reduced sample city, and the rerun that does nothing.
#include "support.h"

#include <gdal_priv.h>
#include <ogrsf_frmts.h>

#include <silvan/silvan.h>

#include <cstdlib>
#include <filesystem>
#include <map>
#include <memory>
#include <string>

#ifndef _WIN32
#include <sys/wait.h>
#endif

namespace {

using testsupport::ReadFile;
using testsupport::TempDir;
using testsupport::WriteFile;

struct Result {
    int status = -1;
    std::string out;
    std::string err;
};

// Runs a program with arguments (each quoted) and collects its exit status and output.
Result Run(const std::string& program, const std::vector<std::string>& args, const TempDir& dir) {
    std::string command = "\"" + program + "\"";
    for (const std::string& arg : args)
        command += " \"" + arg + "\"";
    const std::string out = dir.File("stdout.txt"), err = dir.File("stderr.txt");
    command += " > \"" + out + "\" 2> \"" + err + "\"";
#ifdef _WIN32
    command = "\"" + command + "\"";  // cmd.exe strips the outer quotes
#endif
    Result result;
    const int raw = std::system(command.c_str());
#ifdef _WIN32
    result.status = raw;
#else
    result.status = WIFEXITED(raw) ? WEXITSTATUS(raw) : -1;
#endif
    result.out = ReadFile(out);
    result.err = ReadFile(err);
    return result;
}

#ifdef SILVAN_ORTHO_EXE
const std::string kOrtho = SILVAN_ORTHO_EXE;

Result Ortho(const std::vector<std::string>& args, const TempDir& dir) {
    return Run(kOrtho, args, dir);
}

TEST(WorkflowCommand, RefusesBadCommandLinesWithStatus2) {
    TempDir dir;
    const std::string master = WriteFile(dir.File("master.txt"), "a.tif\n");
    const std::string out = dir.File("out");
    const struct {
        std::vector<std::string> args;
        std::string message;
    } cases[] = {
        {{}, "the master parameter file is missing"},
        {{master, "--dem", "d.tif"}, "--out DIR is missing"},
        {{master, "--out", out}, "exactly one of --dem and --tin"},
        {{master, "--out", out, "--dem", "d.tif", "--tin", "t.gpkg"}, "exactly one of"},
        {{master, "--out", out, "--dem", "d.tif", "--jobs", "0"}, "--jobs: at least one job"},
        {{master, "--out", out, "--dem", "d.tif", "--jobs", "two"}, "\"two\" is not a whole"},
        {{master, "--out", out, "--dem", "d.tif", "--lines", "5:5"}, "empty slice"},
        {{master, "--out", out, "--dem", "d.tif", "--lines", "x:2"}, "--lines: \"x\""},
        {{master, "--out", out, "--dem", "d.tif", "--pixel-size", "-1"}, "is negative"},
        {{master, "--out", out, "--dem", "d.tif", "--pixel-size", "nan"}, "is not a number"},
        {{master, "--out", out, "--dem", "d.tif", "--elfactor", "1,x"}, "\"x\" is not a number"},
        {{master, "--out", out, "--dem"}, "--dem needs a value"},
        {{master, "--out", out, "--dem", "d.tif", "--frobnicate"}, "unknown option"},
        {{master, master, "--out", out, "--dem", "d.tif"}, "one master parameter file"},
    };
    for (const auto& c : cases) {
        const Result r = Ortho(c.args, dir);
        EXPECT_EQ(r.status, 2) << c.message;
        EXPECT_NE(r.err.find(c.message), std::string::npos) << r.err;
    }
    EXPECT_FALSE(std::filesystem::exists(out));

    const Result help = Ortho({"--help"}, dir);
    EXPECT_EQ(help.status, 0);
    EXPECT_NE(help.out.find("usage: silvan-ortho MASTER --out DIR"), std::string::npos);
}

TEST(WorkflowCommand, MissingMasterFileStopsNamingIt) {
    TempDir dir;
    const Result r =
        Ortho({dir.File("absent.txt"), "--out", dir.File("out"), "--dem", "d.tif"}, dir);
    EXPECT_EQ(r.status, 1);
    EXPECT_NE(r.err.find("absent.txt"), std::string::npos) << r.err;
    EXPECT_NE(r.err.find("Invalid MFILE"), std::string::npos) << r.err;
    EXPECT_NE(ReadFile(dir.File("out/summary.json")).find("\"status\": \"failed\""),
              std::string::npos);
}

// A master file whose second data line (line 4 of the file) has a bad channel list and whose
// third names a missing image: the run stops at the first, naming the master file and line;
// with --keep-going both are listed in the summary.
TEST(WorkflowCommand, BadMasterLinesNameFileAndLine) {
    TempDir dir;
    const std::string master = WriteFile(dir.File("master.txt"),
                                         "!MFILE master\n"
                                         "a.tif;1,2,3;0;;0;0;LOW;1;FILL\n"
                                         "\n"
                                         "b.tif;1,x;0;;0;0;HIGH;2;FILL\n"
                                         "a.tif;1;0;;0;0;;0;PREP\n");
    const Result stop = Ortho({master, "--out", dir.File("out"), "--dem", "dsm.tif"}, dir);
    EXPECT_EQ(stop.status, 1);
    EXPECT_NE(stop.err.find("master.txt, line 4, column 1: \"x\" is not an integer"),
              std::string::npos)
        << stop.err;

    // The derived files hold the master file's columns.
    EXPECT_EQ(ReadFile(dir.File("out/prep.txt")),
              "!MFILE created for VARNOK\na.tif;1,2,3;0;;0;0\nb.tif;1,x;0;;0;0\n"
              "a.tif;1;0;;0;0\n");
    EXPECT_EQ(ReadFile(dir.File("out/imgset.txt")),
              "!IMGSET created for MELDRA\na.tif;LOW;1\nb.tif;HIGH;2\n");

    const Result going =
        Ortho({master, "--out", dir.File("out"), "--dem", "dsm.tif", "--keep-going", "-q"}, dir);
    EXPECT_EQ(going.status, 1);
    const std::string summary = ReadFile(dir.File("out/summary.json"));
    EXPECT_NE(summary.find("\"line\": 1, \"source\": \"b.tif\""), std::string::npos) << summary;
    EXPECT_NE(summary.find("master.txt, line 4, column 1"), std::string::npos);
    // The third line repeats the first one's name: its outputs would overwrite the first's.
    EXPECT_NE(summary.find("master.txt, line 5: the scene name \\\"a\\\" is already taken by "
                           "line 2"),
              std::string::npos)
        << summary;
}

TEST(WorkflowCommand, SliceBeyondTheLastLineDoesNothing) {
    TempDir dir;
    const std::string master = WriteFile(dir.File("master.txt"), "a.tif;1;0;;0;0;;0;FILL\n");
    const Result r =
        Ortho({master, "--out", dir.File("out"), "--dem", "dsm.tif", "--lines", "4:8"}, dir);
    EXPECT_EQ(r.status, 0) << r.err;
    const std::string summary = ReadFile(dir.File("out/summary-4-8.json"));
    EXPECT_NE(summary.find("\"scenes\": []"), std::string::npos) << summary;
    EXPECT_FALSE(std::filesystem::exists(dir.File("out/summary.json")));
}
#endif

}  // namespace
