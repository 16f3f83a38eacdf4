// Helpers shared by the tests: scratch directories and file contents.
#pragma once

#include <gtest/gtest.h>

#include <kestrel/exception.h>

#include <filesystem>
#include <fstream>
#include <iterator>
#include <optional>
#include <random>
#include <string>

namespace testsupport {

// A directory of its own for each test, removed with everything in it at the end.
class TempDir {
  public:
    TempDir() {
        std::random_device rd;
        const auto base = std::filesystem::temp_directory_path();
        for (;;) {
            path_ = base / ("silvan-test-" + std::to_string(rd()));
            if (std::filesystem::create_directory(path_))
                break;
        }
    }
    ~TempDir() {
        std::error_code ec;
        std::filesystem::remove_all(path_, ec);
    }
    TempDir(const TempDir&) = delete;
    TempDir& operator=(const TempDir&) = delete;

    const std::filesystem::path& Path() const { return path_; }
    // The path of a file in the directory, as the narrow string the library takes.
    std::string File(const std::string& name) const { return (path_ / name).string(); }

  private:
    std::filesystem::path path_;
};

inline std::string WriteFile(const std::string& path, const std::string& bytes) {
    std::ofstream out(path, std::ios::binary);
    out << bytes;
    return path;
}

inline std::string ReadFile(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

// Checks that an exception names the operation that failed and where it was thrown.
inline void ExpectThrownFrom(const kestrel::Exception& e, const std::string& function,
                             const std::string& sourceFile) {
    EXPECT_EQ(e.GetFunction(), function);
    EXPECT_EQ(e.GetSourceFile(), sourceFile);
    EXPECT_GT(e.GetSourceLine(), 0u);
}

// What `call` throws as an E, for its fields to be checked; none, and a failure naming `what`,
// when it throws nothing.
template <class E = kestrel::Exception, class F>
std::optional<E> Thrown(F&& call, const std::string& what = "") {
    try {
        call();
    } catch (const E& e) {
        return e;
    }
    ADD_FAILURE() << "nothing thrown: " << what;
    return std::nullopt;
}

// The message of what `call` throws as an E, or "(nothing thrown)".
template <class E = kestrel::Exception, class F>
std::string ThrownMessage(F&& call, const std::string& what = "") {
    const std::optional<E> e = Thrown<E>(call, what);
    return e ? std::string(e->what()) : "(nothing thrown)";
}

inline bool Contains(const std::string& text, const std::string& part) {
    return text.find(part) != std::string::npos;
}

// Sets a process's cancel flag (a plain bool) from a worker thread, as the run reads it:
// atomically under GCC and Clang, so that ThreadSanitizer sees no race.
inline void RaiseCancelFlag(bool* flag) {
#if defined(__GNUC__) || defined(__clang__)
    __atomic_store_n(flag, true, __ATOMIC_RELAXED);
#else
    *static_cast<volatile bool*>(flag) = true;
#endif
}

}  // namespace testsupport
