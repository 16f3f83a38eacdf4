#include "runcontrol.h"

#include <algorithm>
#include <exception>
#include <thread>
#include <vector>

#if defined(__GLIBC__)
#include <malloc.h>
#elif defined(_WIN32)
#include <malloc.h>
#endif

namespace kestrel {
namespace processes {
namespace trueortho {

void ReleaseFreeMemory() {
#if defined(__GLIBC__)
    malloc_trim(0);
#elif defined(_WIN32)
    _heapmin();
#endif
}

bool RunControl::Stopped() const {
    if (stop_.load(std::memory_order_relaxed))
        return true;
    // The process's flag is a plain bool that another thread sets: read atomically where the
    // compiler offers it (so that ThreadSanitizer sees no race), else through volatile, so that
    // every check looks at memory again rather than at a value the compiler kept.
#if defined(__GNUC__) || defined(__clang__)
    const bool cancelled = cancel_ != nullptr && __atomic_load_n(cancel_, __ATOMIC_RELAXED);
#else
    const bool cancelled = cancel_ != nullptr && *static_cast<const volatile bool*>(cancel_);
#endif
    if (cancelled) {
        cancelled_ = true;
        stop_ = true;
    }
    return stop_;
}

void RunControl::RunTiles(std::size_t count, unsigned int threads, const char* message,
                          const std::function<void(unsigned int, std::size_t)>& work) {
    std::atomic<std::size_t> next{0};
    std::size_t done = 0;
    std::exception_ptr failure;
    std::mutex failureMutex;
    if (progress_ != nullptr && !progress_(spanStart_, message, userData_))
        cancelled_ = true, stop_ = true;
    auto run = [&](unsigned int thread) {
        for (std::size_t index; !Stopped() && (index = next++) < count;) {
            try {
                work(thread, index);
            } catch (...) {
                std::lock_guard<std::mutex> lock(failureMutex);
                if (!failure)
                    failure = std::current_exception();
                stop_ = true;
                return;
            }
            if (Stopped())
                return;
            std::lock_guard<std::mutex> lock(progressMutex_);
            ++done;
            if (progress_ != nullptr &&
                !progress_(spanStart_ + spanShare_ * static_cast<double>(done) / count, message,
                           userData_))
                cancelled_ = true, stop_ = true;
        }
    };
    threads =
        static_cast<unsigned int>(std::max<std::size_t>(1, std::min<std::size_t>(threads, count)));
    std::vector<std::thread> pool;
    try {
        for (unsigned int t = 1; t < threads; ++t)
            pool.emplace_back(run, t);
    } catch (...) {
        stop_ = true;
        for (auto& t : pool)
            t.join();
        throw;
    }
    run(0);
    for (auto& t : pool)
        t.join();
    if (failure)
        std::rethrow_exception(failure);
}

}  // namespace trueortho
}  // namespace processes
}  // namespace kestrel
