// Process-parameter utilities: the reading of a process's PROC option.
//
// The PROC text syntax is documented in docs/proc.md.
#pragma once

#include <functional>
#include <string>
#include <vector>

#include <kestrel/export.h>

// On what kind of processor a process runs its generator. The underlying type is fixed so that
// any integer value can be held (and passed on by callers that treat unknown values their way).
enum ProcessStrategy : int {
    PROCESS_STRATEGY_AUTO = 0,  // the generator library chooses
    PROCESS_STRATEGY_CPU = 1,   // central processor
    PROCESS_STRATEGY_GPU = 2    // graphics processor, falling back to the central processor
};

// Reads a PROC text and sets every output:
//   strategy  the processor kind;
//   first     central-processor thread count, 0 to let the generator choose;
//   second    work streams per graphics processor, 0 to let the generator choose (GPU only);
//   third     number of graphics processors to use when none are listed, 0 for every usable
//             one (GPU only);
//   list      the graphics processors listed by number, empty when none are (GPU only).
// Integers that the strategy does not use are 0. Throws DataException quoting the text and
// listing the accepted forms when the text cannot be read; the outputs are then unchanged.
KESTREL_API void GetProcessParameters(const std::string& proc, ProcessStrategy& strategy,
                                      int& first, int& second, int& third, std::vector<int>& list);

// The built-in reader of the PROC syntax, which GetProcessParameters uses unless a reader has
// been installed with SetProcessParametersReader.
KESTREL_API void ParseProcOption(const std::string& proc, ProcessStrategy& strategy, int& first,
                                 int& second, int& third, std::vector<int>& list);

// A replacement for the reading done by GetProcessParameters, for tests that need outputs the
// syntax cannot produce (strategies other than 0, 1 and 2, for instance).
using ProcessParametersReader =
    std::function<void(const std::string& proc, ProcessStrategy& strategy, int& first, int& second,
                       int& third, std::vector<int>& list)>;

// Installs reader (an empty one restores the built-in reader) and returns the one it replaces.
// Not meant to be called while another thread reads a PROC text.
KESTREL_API ProcessParametersReader SetProcessParametersReader(ProcessParametersReader reader);

// Installs a reader for its own lifetime and restores the previous one after.
class KESTREL_API ScopedProcessParametersReader {
  public:
    explicit ScopedProcessParametersReader(ProcessParametersReader reader);
    ~ScopedProcessParametersReader();
    ScopedProcessParametersReader(const ScopedProcessParametersReader&) = delete;
    ScopedProcessParametersReader& operator=(const ScopedProcessParametersReader&) = delete;

  private:
    ProcessParametersReader previous_;
};
