// What the commands print for an error: the message with the file or value it is about, never
// where in the code it was raised.
#pragma once

#include <kestrel/exception.h>

#include <exception>
#include <filesystem>
#include <string>

namespace tools {

// One line saying what went wrong, with the file name of file errors and the value refused by
// parameter errors, when the message does not hold them already.
inline std::string UserMessage(const std::exception& error) {
    if (const auto* parameter = dynamic_cast<const kestrel::ParameterException*>(&error)) {
        std::string message = parameter->GetErrorMessage();
        const std::string& value = parameter->GetValue();
        const std::string shown = value.empty() ? parameter->GetParameterName() : value;
        if (!shown.empty() && message.find(shown) == std::string::npos)
            message = shown + ": " + message;
        if (!parameter->GetExpected().empty() &&
            message.find(parameter->GetExpected()) == std::string::npos)
            message += " (expected: " + parameter->GetExpected() + ")";
        return message;
    }
    const auto* file = dynamic_cast<const kestrel::FileException*>(&error);
    if (file == nullptr || file->GetFileName().empty())
        return error.what();
    std::string message = file->GetErrorMessage();
    if (message.empty() && dynamic_cast<const kestrel::FileNotFoundException*>(&error) != nullptr) {
        // Said without a message only by the raster opening, which cannot tell the two apart.
        std::error_code ec;
        message = std::filesystem::exists(file->GetFileName(), ec)
                      ? "not a raster that GDAL can read"
                      : "not found";
    } else if (message.empty()) {
        message = "cannot be used";
    }
    if (message.find(file->GetFileName()) != std::string::npos)
        return message;
    return file->GetFileName() + ": " + message;
}

}  // namespace tools
