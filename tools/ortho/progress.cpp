#include "progress.h"

#include <algorithm>
#include <cmath>

#ifdef _WIN32
#include <io.h>
#else
#include <unistd.h>
#endif

namespace ortho {

bool IsTerminal(std::FILE* stream) {
#ifdef _WIN32
    return _isatty(_fileno(stream)) != 0;
#else
    return isatty(fileno(stream)) != 0;
#endif
}

namespace {

constexpr int kBarWidth = 24;
constexpr std::size_t kLineWidth = 79;
// Redraws closer together than this only flicker.
constexpr std::chrono::milliseconds kRedrawInterval(100);

int Percent(double fraction) {
    return static_cast<int>(std::lround(std::clamp(fraction, 0.0, 1.0) * 100.0));
}

}  // namespace

Progress::Progress(std::FILE* stream, bool terminal, bool quiet)
    : stream_(stream), terminal_(terminal && !quiet), quiet_(quiet) {}

Progress::~Progress() {
    std::lock_guard<std::mutex> lock(mutex_);
    Clear();
}

void Progress::SetTotal(unsigned int total) {
    std::lock_guard<std::mutex> lock(mutex_);
    total_ = total;
    finished_ = 0;
}

void Progress::Begin(const std::string& scene) {
    std::lock_guard<std::mutex> lock(mutex_);
    running_[scene] = Running();
    if (terminal_)
        Draw(true);
    else if (!quiet_)
        Print("started " + scene);
}

void Progress::Update(const std::string& scene, double fraction, const std::string& step) {
    std::lock_guard<std::mutex> lock(mutex_);
    auto found = running_.find(scene);
    if (found == running_.end())
        return;
    const bool newStep = found->second.step != step;
    found->second.fraction = fraction;
    found->second.step = step;
    if (terminal_)
        Draw(false);
    else if (!quiet_ && newStep)
        Print(scene + ": " + step);
}

void Progress::End(const std::string& scene, bool succeeded, double seconds,
                   const std::string& error) {
    std::lock_guard<std::mutex> lock(mutex_);
    running_.erase(scene);
    ++finished_;
    char text[64];
    std::snprintf(text, sizeof text, " (%u/%u, %.1f s)", finished_, total_, seconds);
    if (!succeeded)
        Print("FAILED " + scene + text + ": " + error);
    else if (!quiet_)
        Print("done " + scene + text);
    if (terminal_)
        Draw(true);
}

void Progress::Done() {
    std::lock_guard<std::mutex> lock(mutex_);
    Clear();
    std::fflush(stream_);
}

void Progress::Info(const std::string& text) {
    std::lock_guard<std::mutex> lock(mutex_);
    if (quiet_)
        return;
    Print(text);
    if (terminal_ && !running_.empty())
        Draw(true);
}

void Progress::Error(const std::string& text) {
    std::lock_guard<std::mutex> lock(mutex_);
    Print(text);
    if (terminal_ && !running_.empty())
        Draw(true);
}

void Progress::Print(const std::string& text) {
    Clear();
    std::fprintf(stream_, "silvan-ortho: %s\n", text.c_str());
    std::fflush(stream_);
}

void Progress::Clear() {
    if (drawn_ == 0)
        return;
    std::fprintf(stream_, "\r%s\r", std::string(drawn_, ' ').c_str());
    drawn_ = 0;
}

void Progress::Draw(bool force) {
    const auto now = std::chrono::steady_clock::now();
    if (!force && now - lastDraw_ < kRedrawInterval)
        return;
    lastDraw_ = now;
    // Overall: finished scenes plus the parts of the running ones.
    double done = finished_;
    for (const auto& scene : running_)
        done += std::clamp(scene.second.fraction, 0.0, 1.0);
    const double overall = total_ > 0 ? done / total_ : 1.0;
    const int filled = static_cast<int>(overall * kBarWidth);
    std::string line = "[" + std::string(static_cast<std::size_t>(filled), '#') +
                       std::string(static_cast<std::size_t>(kBarWidth - filled), '.') + "] ";
    char count[48];
    std::snprintf(count, sizeof count, "%3d%% %u/%u", Percent(overall), finished_, total_);
    line += count;
    for (const auto& scene : running_) {
        char part[16];
        std::snprintf(part, sizeof part, " %d%%", Percent(scene.second.fraction));
        line += " | " + scene.first + " " + scene.second.step + part;
    }
    if (line.size() > kLineWidth)
        line = line.substr(0, kLineWidth - 3) + "...";
    const std::size_t width = line.size();
    if (width < drawn_)
        line += std::string(drawn_ - width, ' ');
    std::fprintf(stream_, "\r%s", line.c_str());
    std::fflush(stream_);
    drawn_ = std::max(width, drawn_);
}

}  // namespace ortho
