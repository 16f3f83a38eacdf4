// The suite's exception family, its printf-style formatter and message translation.
#pragma once

#include <exception>
#include <string>

#include <kestrel/export.h>

#if defined(_MSC_VER)
#define KESTREL_FUNCSIG __FUNCSIG__
#else
#define KESTREL_FUNCSIG __PRETTY_FUNCTION__
#endif

#if defined(__GNUC__)
#define KESTREL_PRINTF_FORMAT(fmt, args) __attribute__((format(printf, fmt, args)))
#else
#define KESTREL_PRINTF_FORMAT(fmt, args)
#endif

namespace kestrel {

namespace detail {
// The file name of a source path without its directories, so that messages do not carry the
// build machine's paths.
constexpr const char* SourceBaseName(const char* path) {
    const char* base = path;
    for (const char* p = path; *p != '\0'; ++p) {
        if (*p == '/' || *p == '\\')
            base = p + 1;
    }
    return base;
}
}  // namespace detail

// Where a failure was detected: handed to shared checks so that the exception names the
// operation the caller called, not the helper.
struct SourceLocation {
    const char* file;
    const char* function;
    unsigned int line;
};

// The location of the statement in which it stands.
#define KESTREL_HERE                                                                         \
    (::kestrel::SourceLocation{::kestrel::detail::SourceBaseName(__FILE__), KESTREL_FUNCSIG, \
                               __LINE__})

// Throws an exception of the family, filling in source file, function signature and line.
#define KESTREL_THROW(ExceptionType, ...)                                                          \
    throw ExceptionType(__VA_ARGS__, ::kestrel::detail::SourceBaseName(__FILE__), KESTREL_FUNCSIG, \
                        __LINE__)

// Throws at a location recorded elsewhere (see KESTREL_HERE).
#define KESTREL_THROW_AT(where, ExceptionType, ...) \
    throw ExceptionType(__VA_ARGS__, (where).file, (where).function, (where).line)

class KESTREL_API Exception : public std::exception {
  public:
    Exception(const std::string& message, const std::string& file, const std::string& function,
              unsigned int line);
    ~Exception() override;
    Exception(const Exception&);
    Exception& operator=(const Exception&);

    // The message alone, so that it can be embedded in another message.
    const char* what() const noexcept override;

    const std::string& GetErrorMessage() const { return message_; }
    const std::string& GetSourceFile() const { return file_; }
    const std::string& GetFunction() const { return function_; }
    unsigned int GetSourceLine() const { return line_; }

    // Message followed by where it was raised: "message (in function, file:line)".
    std::string Describe() const;

  private:
    std::string message_;
    std::string file_;
    std::string function_;
    unsigned int line_;
};

class KESTREL_API DataException : public Exception {
  public:
    DataException(const std::string& message, const std::string& file, const std::string& function,
                  unsigned int line);
    ~DataException() override;
    DataException(const DataException&);
    DataException& operator=(const DataException&);
};

class KESTREL_API ParameterException : public DataException {
  public:
    enum Type {
        InvalidFile = 0,  // a parameter file that cannot be used
        Unsupported = 1,  // a value that is not supported
        OutOfRange = 2,   // a value outside its range
        EmptyValue = 3    // an empty value
    };

    ParameterException(const std::string& parameterName, Type type, const std::string& value,
                       const std::string& expected, const std::string& message,
                       const std::string& file, const std::string& function, unsigned int line);
    ~ParameterException() override;
    ParameterException(const ParameterException&);
    ParameterException& operator=(const ParameterException&);

    const std::string& GetParameterName() const { return parameterName_; }
    Type GetType() const { return type_; }
    const std::string& GetValue() const { return value_; }
    const std::string& GetExpected() const { return expected_; }

  private:
    std::string parameterName_;
    Type type_;
    std::string value_;
    std::string expected_;
};

class KESTREL_API IOException : public Exception {
  public:
    IOException(const std::string& message, const std::string& file, const std::string& function,
                unsigned int line);
    ~IOException() override;
    IOException(const IOException&);
    IOException& operator=(const IOException&);
};

class KESTREL_API FileException : public IOException {
  public:
    FileException(const std::string& fileName, const std::string& message, const std::string& file,
                  const std::string& function, unsigned int line);
    ~FileException() override;
    FileException(const FileException&);
    FileException& operator=(const FileException&);

    const std::string& GetFileName() const { return fileName_; }

  private:
    std::string fileName_;
};

class KESTREL_API FileAccessException : public FileException {
  public:
    enum Type {
        AccessFailed = 0,  // any other access failure
        ReadFailed = 1,    // the file's content cannot be read as expected
        WriteFailed = 2,
        OpenFailed = 3,
        DeleteFailed = 4,
        CreateFailed = 5  // the file cannot be created
    };

    FileAccessException(const std::string& fileName, const Type& type, const std::string& message,
                        const std::string& file, const std::string& function, unsigned int line);
    ~FileAccessException() override;
    FileAccessException(const FileAccessException&);
    FileAccessException& operator=(const FileAccessException&);

    Type GetType() const { return type_; }

  private:
    Type type_;
};

class KESTREL_API FileNotFoundException : public FileException {
  public:
    FileNotFoundException(const std::string& fileName, const std::string& message,
                          const std::string& file, const std::string& function, unsigned int line);
    ~FileNotFoundException() override;
    FileNotFoundException(const FileNotFoundException&);
    FileNotFoundException& operator=(const FileNotFoundException&);
};

// printf-style formatting into a string; any length.
KESTREL_API std::string FormatString(const char* format, ...) KESTREL_PRINTF_FORMAT(1, 2);

// Message translation: the text to show for a message text. No catalogue is loaded, so the
// text is returned unchanged.
KESTREL_API const char* _(const char* text);

}  // namespace kestrel
