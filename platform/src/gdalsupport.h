// GDAL inside the platform: registration, and GDAL's error reports turned into our exceptions
// at one place, without leaving GDAL's global error state to callers.
#pragma once

#include <string>

namespace kestrel {
namespace gdalsupport {

// Registers GDAL's drivers once per process and keeps GDAL quiet on standard error.
void EnsureRegistered();

// Collects the errors that GDAL raises on this thread while it lives, instead of printing
// them; on leaving it restores the previous handler and resets GDAL's error state.
class ErrorCapture {
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
