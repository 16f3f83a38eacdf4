// GDAL's registration, and GDAL's error reports collected at one place so that callers turn
// them into exceptions, without leaving GDAL's global error state behind. The platform uses it
// around every GDAL call; programs that call GDAL themselves use it too.
#pragma once

#include <string>

#include <kestrel/export.h>

namespace kestrel {
namespace gdalsupport {

// Registers GDAL's drivers once per process and keeps GDAL quiet on standard error.
KESTREL_API void EnsureRegistered();

// Collects the errors that GDAL raises on this thread while it lives, instead of printing
// them; on leaving it restores the previous handler and resets GDAL's error state.
class KESTREL_API ErrorCapture {
  public:
    ErrorCapture();
    ~ErrorCapture();
    ErrorCapture(const ErrorCapture&) = delete;
    ErrorCapture& operator=(const ErrorCapture&) = delete;

    // The last failure's message (warnings when there was no failure), or else fallback.
    std::string Reason(const char* fallback = "unknown reason") const;
    bool Failed() const { return failed_; }

  private:
    static void Handler(int errorClass, int errorNumber, const char* message);
    std::string failure_;
    std::string warning_;
    bool failed_ = false;
};

}  // namespace gdalsupport
}  // namespace kestrel
