// Fixtures shared by the suites: temporary directories and files, trace
// capture, environment variables set for the length of a scope.
#ifndef DPX_TEST_SUPPORT_H
#define DPX_TEST_SUPPORT_H

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace dpxtest {

// A fresh directory under $TMPDIR (or /tmp), removed with all in it.
class TempDir {
public:
    TempDir();
    ~TempDir();
    TempDir(const TempDir &) = delete;
    TempDir &operator=(const TempDir &) = delete;
    const std::string &path() const { return path_; }
    std::string operator/(const std::string &name) const { return path_ + "/" + name; }

private:
    std::string path_;
};

// Whole files; a failure fails the test.
void write_file(const std::string &path, const std::string &bytes);
std::string read_file(const std::string &path);
bool file_exists(const std::string &path);
// Deterministic pseudo-random bytes.
std::string pattern_bytes(size_t size, uint32_t seed = 1);
std::vector<std::string> files_with_prefix(const std::string &dir, const std::string &prefix);

// Sets (or, with nullopt, unsets) an environment variable until the end of
// the scope.
class ScopedEnv {
public:
    ScopedEnv(std::string name, std::optional<std::string> value);
    ~ScopedEnv();
    ScopedEnv(const ScopedEnv &) = delete;
    ScopedEnv &operator=(const ScopedEnv &) = delete;

private:
    std::string name_;
    std::optional<std::string> old_;
};

// The tracing library writes to a file with `flags` for the length of the scope.
class TraceCapture {
public:
    explicit TraceCapture(uint32_t flags);
    ~TraceCapture();
    TraceCapture(const TraceCapture &) = delete;
    TraceCapture &operator=(const TraceCapture &) = delete;
    std::string text() const { return read_file(file_); }
    bool contains(const std::string &needle) const { return text().find(needle) != std::string::npos; }
    size_t count(const std::string &needle) const;

private:
    TempDir dir_;
    std::string file_;
};

// Directory of the built programs (DPX_BIN_DIR, set by CTest).
std::string bin_dir();

}  // namespace dpxtest

#endif
