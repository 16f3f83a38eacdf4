// Running a command-line program of the project as a user does, for the tests of its commands.
#pragma once

#include "support.h"

#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#ifdef _WIN32
#define popen _popen
#define pclose _pclose
#else
#include <sys/wait.h>
#endif

namespace testsupport {

struct ProgramResult {
    int status = -1;
    std::string out;
    std::string err;
};

// Runs a program with arguments (each quoted) and collects its exit status and output; the
// output goes through files in dir.
inline ProgramResult RunProgram(const std::string& program, const std::vector<std::string>& args,
                                const TempDir& dir) {
    std::string command = "\"" + program + "\"";
    for (const std::string& arg : args)
        command += " \"" + arg + "\"";
    const std::string out = dir.File("stdout.txt"), err = dir.File("stderr.txt");
    command += " > \"" + out + "\" 2> \"" + err + "\"";
#ifdef _WIN32
    command = "\"" + command + "\"";  // cmd.exe strips the outer quotes
#endif
    ProgramResult result;
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

// Runs a shell command line and returns its standard output.
inline std::string RunCommand(const std::string& command) {
    std::string output;
    FILE* pipe = popen(command.c_str(), "r");
    if (pipe == nullptr)
        return output;
    char buffer[4096];
    for (std::size_t n; (n = std::fread(buffer, 1, sizeof buffer, pipe)) > 0;)
        output.append(buffer, n);
    pclose(pipe);
    return output;
}

}  // namespace testsupport
