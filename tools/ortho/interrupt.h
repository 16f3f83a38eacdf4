// Ctrl-C and termination requests (SIGINT, SIGTERM; Ctrl-C on Windows arrives as SIGINT): the
// handler only sets a flag, which the run polls between steps and the generators through their
// progress, so that a run stops within one tile, cleans up and reports itself cancelled. A
// second request ends the process at once.
#pragma once

namespace ortho {

void CatchInterrupts();
bool Interrupted();

// The exit status of an interrupted run, as shells give a process ended by SIGINT.
constexpr int kInterruptedStatus = 130;

}  // namespace ortho
