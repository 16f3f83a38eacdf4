// Helpers shared by the benchmarks: peak memory, scratch files and measured child processes.
#pragma once

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <string>
#include <vector>

#if defined(_WIN32)
#define WIN32_LEAN_AND_MEAN
#include <psapi.h>
#include <windows.h>
#else
#include <fcntl.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>
#endif

namespace benchsupport {

// Peak resident memory of this process so far, in bytes.
inline std::uint64_t PeakMemoryBytes() {
#if defined(_WIN32)
    PROCESS_MEMORY_COUNTERS counters{};
    GetProcessMemoryInfo(GetCurrentProcess(), &counters, sizeof counters);
    return counters.PeakWorkingSetSize;
#else
    rusage usage{};
    getrusage(RUSAGE_SELF, &usage);
    return static_cast<std::uint64_t>(usage.ru_maxrss) * 1024u;
#endif
}

// A scratch directory for generated input, kept between runs of the same program so that
// large files are generated once.
inline std::filesystem::path ScratchDir(const std::string& name) {
    const auto dir = std::filesystem::temp_directory_path() / ("silvan-bench-" + name);
    std::filesystem::create_directories(dir);
    return dir;
}

// A child process's exit status, wall-clock and processor seconds and peak resident memory.
struct ChildRun {
    int status = -1;  // the exit status; -1 when it could not be started or did not exit
    double wallSeconds = 0, cpuSeconds = 0;
    std::uint64_t peakBytes = 0;
};

// Runs a program (found on PATH when it has no directory) with the given arguments, its output
// and errors into logPath, and measures it.
inline ChildRun RunMeasured(const std::vector<std::string>& argv, const std::string& logPath) {
    ChildRun run;
    const auto start = std::chrono::steady_clock::now();
#if defined(_WIN32)
    std::string command;
    for (const std::string& a : argv)
        command += (command.empty() ? "\"" : " \"") + a + "\"";
    SECURITY_ATTRIBUTES inherit{sizeof(SECURITY_ATTRIBUTES), nullptr, TRUE};
    HANDLE log = CreateFileA(logPath.c_str(), GENERIC_WRITE, FILE_SHARE_READ, &inherit,
                             CREATE_ALWAYS, FILE_ATTRIBUTE_NORMAL, nullptr);
    STARTUPINFOA startup{};
    startup.cb = sizeof startup;
    startup.dwFlags = STARTF_USESTDHANDLES;
    startup.hStdOutput = startup.hStdError = log;
    PROCESS_INFORMATION process{};
    if (log != INVALID_HANDLE_VALUE &&
        CreateProcessA(nullptr, &command[0], nullptr, nullptr, TRUE, 0, nullptr, nullptr,
                       &startup, &process)) {
        WaitForSingleObject(process.hProcess, INFINITE);
        DWORD code = 0;
        GetExitCodeProcess(process.hProcess, &code);
        run.status = static_cast<int>(code);
        FILETIME created, ended, kernel, user;
        if (GetProcessTimes(process.hProcess, &created, &ended, &kernel, &user)) {
            auto seconds = [](const FILETIME& t) {
                return ((static_cast<std::uint64_t>(t.dwHighDateTime) << 32) | t.dwLowDateTime) *
                       1e-7;
            };
            run.cpuSeconds = seconds(kernel) + seconds(user);
        }
        PROCESS_MEMORY_COUNTERS counters{};
        if (GetProcessMemoryInfo(process.hProcess, &counters, sizeof counters))
            run.peakBytes = counters.PeakWorkingSetSize;
        CloseHandle(process.hThread);
        CloseHandle(process.hProcess);
    }
    if (log != INVALID_HANDLE_VALUE)
        CloseHandle(log);
#else
    std::vector<char*> args;
    for (const std::string& a : argv)
        args.push_back(const_cast<char*>(a.c_str()));
    args.push_back(nullptr);
    const int log = open(logPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    if (log < 0)
        return run;
    const pid_t pid = fork();
    if (pid == 0) {
        dup2(log, 1);
        dup2(log, 2);
        execvp(args[0], args.data());
        _exit(127);
    }
    close(log);
    int status = 0;
    rusage usage{};
    if (pid > 0 && wait4(pid, &status, 0, &usage) == pid) {
        run.status = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
        run.cpuSeconds = usage.ru_utime.tv_sec + usage.ru_utime.tv_usec * 1e-6 +
                         usage.ru_stime.tv_sec + usage.ru_stime.tv_usec * 1e-6;
        run.peakBytes = static_cast<std::uint64_t>(usage.ru_maxrss) * 1024u;
    }
#endif
    run.wallSeconds =
        std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
    return run;
}

}  // namespace benchsupport
