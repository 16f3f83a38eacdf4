// Running a generator's tiles on several threads, with the process's cancel flag and a
// progress callback in GDAL's style.
#pragma once

#include <kestrel/trueortho.h>

#include <atomic>
#include <cstddef>
#include <functional>
#include <mutex>

namespace kestrel {
namespace processes {
namespace trueortho {

class RunControl {
  public:
    RunControl(const bool* cancel, ProgressFunc progress, void* userData)
        : cancel_(cancel), progress_(progress), userData_(userData) {}

    // True once the cancel flag is set, the progress callback has returned false or a tile has
    // failed. Cheap enough to ask every few lines.
    bool Stopped() const;
    bool Cancelled() const { return cancelled_; }

    // Runs work(thread, index) for every index in [0, count) on up to `threads` threads, tiles
    // taken in order, and reports progress after each. Every thread has ended when it returns;
    // a failure of any tile stops the others and is thrown here.
    void RunTiles(std::size_t count, unsigned int threads, const char* message,
                  const std::function<void(unsigned int thread, std::size_t index)>& work);

    // Later runs report their progress within [start, start + share] of the whole, for a run
    // of several steps.
    void SetSpan(double start, double share) { spanStart_ = start, spanShare_ = share; }
    double SpanStart() const { return spanStart_; }
    double SpanShare() const { return spanShare_; }

  private:
    double spanStart_ = 0, spanShare_ = 1;
    const bool* cancel_;
    ProgressFunc progress_;
    void* userData_;
    mutable std::atomic<bool> stop_{false};
    mutable std::atomic<bool> cancelled_{false};
    std::mutex progressMutex_;
};

// Hands the heap's free pages back to the system. Between steps of many threads: the C library
// keeps what each thread freed for that thread's later use, and the next step's threads, or
// the thread that carries on alone, would not reuse it, so the process would hold the largest
// free memory of every step at once.
void ReleaseFreeMemory();

}  // namespace trueortho
}  // namespace processes
}  // namespace kestrel
