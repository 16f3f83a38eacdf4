// What a run tells its user while it works: a progress bar on a terminal (overall, and each
// running scene), plain log lines otherwise. Safe to call from several threads.
#pragma once

#include <chrono>
#include <cstdio>
#include <map>
#include <mutex>
#include <string>

namespace ortho {

// Whether the stream is an interactive terminal.
bool IsTerminal(std::FILE* stream);

class Progress {
  public:
    // total: the number of scenes to make in this run. A quiet reporter prints errors only.
    Progress(std::FILE* stream, bool terminal, bool quiet);
    ~Progress();
    Progress(const Progress&) = delete;
    Progress& operator=(const Progress&) = delete;

    void SetTotal(unsigned int total);
    // A scene starts, advances (fraction 0..1, with the step it is in), ends.
    void Begin(const std::string& scene);
    void Update(const std::string& scene, double fraction, const std::string& step);
    void End(const std::string& scene, bool succeeded, double seconds, const std::string& error);

    // A line of its own: informational (not shown when quiet) or an error (always shown).
    // Takes the bar off the screen, before other output follows.
    void Done();

    void Info(const std::string& text);
    void Error(const std::string& text);

  private:
    void Print(const std::string& text);  // with the lock held
    void Draw(bool force);                // with the lock held
    void Clear();                         // with the lock held

    std::mutex mutex_;
    std::FILE* stream_;
    bool terminal_;
    bool quiet_;
    unsigned int total_ = 0;
    unsigned int finished_ = 0;
    struct Running {
        double fraction = 0.0;
        std::string step;
    };
    std::map<std::string, Running> running_;
    std::size_t drawn_ = 0;  // characters of the bar on screen
    std::chrono::steady_clock::time_point lastDraw_;
};

}  // namespace ortho
