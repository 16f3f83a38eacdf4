#include <kestrel/exception.h>

#include <cstdarg>
#include <cstdio>
#include <vector>

namespace kestrel {

Exception::Exception(const std::string& message, const std::string& file,
                     const std::string& function, unsigned int line)
    : message_(message), file_(file), function_(function), line_(line) {}
Exception::~Exception() = default;
Exception::Exception(const Exception&) = default;
Exception& Exception::operator=(const Exception&) = default;

const char* Exception::what() const noexcept {
    return message_.c_str();
}

std::string Exception::Describe() const {
    return message_ + " (in " + function_ + ", " + file_ + ":" + std::to_string(line_) + ")";
}

DataException::DataException(const std::string& message, const std::string& file,
                             const std::string& function, unsigned int line)
    : Exception(message, file, function, line) {}
DataException::~DataException() = default;
DataException::DataException(const DataException&) = default;
DataException& DataException::operator=(const DataException&) = default;

ParameterException::ParameterException(const std::string& parameterName, Type type,
                                       const std::string& value, const std::string& expected,
                                       const std::string& message, const std::string& file,
                                       const std::string& function, unsigned int line)
    : DataException(message, file, function, line),
      parameterName_(parameterName),
      type_(type),
      value_(value),
      expected_(expected) {}
ParameterException::~ParameterException() = default;
ParameterException::ParameterException(const ParameterException&) = default;
ParameterException& ParameterException::operator=(const ParameterException&) = default;

IOException::IOException(const std::string& message, const std::string& file,
                         const std::string& function, unsigned int line)
    : Exception(message, file, function, line) {}
IOException::~IOException() = default;
IOException::IOException(const IOException&) = default;
IOException& IOException::operator=(const IOException&) = default;

FileException::FileException(const std::string& fileName, const std::string& message,
                             const std::string& file, const std::string& function,
                             unsigned int line)
    : IOException(message, file, function, line), fileName_(fileName) {}
FileException::~FileException() = default;
FileException::FileException(const FileException&) = default;
FileException& FileException::operator=(const FileException&) = default;

FileAccessException::FileAccessException(const std::string& fileName, const Type& type,
                                         const std::string& message, const std::string& file,
                                         const std::string& function, unsigned int line)
    : FileException(fileName, message, file, function, line), type_(type) {}
FileAccessException::~FileAccessException() = default;
FileAccessException::FileAccessException(const FileAccessException&) = default;
FileAccessException& FileAccessException::operator=(const FileAccessException&) = default;

FileNotFoundException::FileNotFoundException(const std::string& fileName,
                                             const std::string& message, const std::string& file,
                                             const std::string& function, unsigned int line)
    : FileException(fileName, message, file, function, line) {}
FileNotFoundException::~FileNotFoundException() = default;
FileNotFoundException::FileNotFoundException(const FileNotFoundException&) = default;
FileNotFoundException& FileNotFoundException::operator=(const FileNotFoundException&) = default;

std::string FormatString(const char* format, ...) {
    char onStack[256];
    std::va_list args;
    va_start(args, format);
    std::va_list retry;
    va_copy(retry, args);
    const int needed = std::vsnprintf(onStack, sizeof onStack, format, args);
    va_end(args);
    if (needed < 0) {
        va_end(retry);
        return std::string(format);  // an encoding error: show the format rather than nothing
    }
    if (static_cast<std::size_t>(needed) < sizeof onStack) {
        va_end(retry);
        return std::string(onStack, static_cast<std::size_t>(needed));
    }
    std::vector<char> large(static_cast<std::size_t>(needed) + 1);
    std::vsnprintf(large.data(), large.size(), format, retry);
    va_end(retry);
    return std::string(large.data(), static_cast<std::size_t>(needed));
}

const char* _(const char* text) {
    return text;
}

}  // namespace kestrel
