#include <kestrel/gdalsupport.h>

#include <mutex>

#include <cpl_error.h>
#include <gdal.h>
#include <ogr_api.h>

namespace kestrel {
namespace gdalsupport {

void EnsureRegistered() {
    static std::once_flag once;
    std::call_once(once, [] {
        GDALAllRegister();
        // Errors reach callers as exceptions; nothing is printed on standard error.
        CPLSetErrorHandler(CPLQuietErrorHandler);
    });
}

ErrorCapture::ErrorCapture() {
    CPLErrorReset();
    CPLPushErrorHandlerEx(
        [](CPLErr errorClass, CPLErrorNum errorNumber, const char* message) {
            Handler(static_cast<int>(errorClass), errorNumber, message);
        },
        this);
}

ErrorCapture::~ErrorCapture() {
    CPLPopErrorHandler();
    CPLErrorReset();
}

void ErrorCapture::Handler(int errorClass, int /*errorNumber*/, const char* message) {
    auto* self = static_cast<ErrorCapture*>(CPLGetErrorHandlerUserData());
    if (self == nullptr)
        return;
    const std::string text = message != nullptr ? message : "";
    if (errorClass >= CE_Failure) {
        self->failed_ = true;
        self->failure_ = text;
    } else if (errorClass == CE_Warning) {
        self->warning_ = text;
    }
}

std::string ErrorCapture::Reason(const char* fallback) const {
    if (!failure_.empty())
        return failure_;
    if (!warning_.empty())
        return warning_;
    return fallback;
}

}  // namespace gdalsupport
}  // namespace kestrel
