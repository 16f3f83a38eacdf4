#include "interrupt.h"

#include <atomic>
#include <csignal>

namespace ortho {

namespace {

// A lock-free atomic is safe to set from a signal handler.
std::atomic<bool> interrupted{false};
static_assert(std::atomic<bool>::is_always_lock_free, "the interrupt flag must be lock-free");

extern "C" void OnInterrupt(int signal) {
    interrupted.store(true);
    // The next request of the same kind ends the process the default way.
    std::signal(signal, SIG_DFL);
}

}  // namespace

void CatchInterrupts() {
    std::signal(SIGINT, OnInterrupt);
    std::signal(SIGTERM, OnInterrupt);
}

bool Interrupted() {
    return interrupted.load();
}

}  // namespace ortho
