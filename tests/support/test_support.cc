#include "test_support.h"

#include "trc/trc1.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <random>
#include <sstream>

namespace fs = std::filesystem;

namespace dpxtest {

TempDir::TempDir()
{
    const char *base = std::getenv("TMPDIR");
    std::string templ = std::string(base != nullptr && *base != '\0' ? base : "/tmp") + "/dpxtest.XXXXXX";
    std::vector<char> buf(templ.begin(), templ.end());
    buf.push_back('\0');
    char *made = mkdtemp(buf.data());
    EXPECT_NE(made, nullptr) << "mkdtemp failed";
    path_ = made != nullptr ? made : "";
}

TempDir::~TempDir()
{
    std::error_code ec;
    if (!path_.empty()) {
        // Make everything removable first: tests take permissions away.
        for (auto it = fs::recursive_directory_iterator(path_, fs::directory_options::skip_permission_denied, ec);
             it != fs::recursive_directory_iterator(); it.increment(ec)) {
            fs::permissions(it->path(), fs::perms::owner_all, fs::perm_options::add, ec);
        }
        fs::remove_all(path_, ec);
    }
}

void write_file(const std::string &path, const std::string &bytes)
{
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    ASSERT_TRUE(out.good()) << "cannot write " << path;
    out.write(bytes.data(), static_cast<std::streamsize>(bytes.size()));
    ASSERT_TRUE(out.good()) << "cannot write " << path;
}

std::string read_file(const std::string &path)
{
    std::ifstream in(path, std::ios::binary);
    EXPECT_TRUE(in.good()) << "cannot read " << path;
    std::ostringstream s;
    s << in.rdbuf();
    return s.str();
}

bool file_exists(const std::string &path)
{
    std::error_code ec;
    return fs::exists(path, ec);
}

std::string pattern_bytes(size_t size, uint32_t seed)
{
    std::string out(size, '\0');
    std::mt19937 gen(seed);
    for (size_t i = 0; i < size; ++i)
        out[i] = static_cast<char>(gen() & 0xFF);
    return out;
}

std::vector<std::string> files_with_prefix(const std::string &dir, const std::string &prefix)
{
    std::vector<std::string> out;
    std::error_code ec;
    for (const auto &entry : fs::directory_iterator(dir, ec)) {
        std::string name = entry.path().filename().string();
        if (name.rfind(prefix, 0) == 0)
            out.push_back(entry.path().string());
    }
    return out;
}

ScopedEnv::ScopedEnv(std::string name, std::optional<std::string> value) : name_(std::move(name))
{
    if (const char *old = std::getenv(name_.c_str()))
        old_ = old;
    if (value)
        setenv(name_.c_str(), value->c_str(), 1);
    else
        unsetenv(name_.c_str());
}

ScopedEnv::~ScopedEnv()
{
    if (old_)
        setenv(name_.c_str(), old_->c_str(), 1);
    else
        unsetenv(name_.c_str());
}

TraceCapture::TraceCapture(uint32_t flags) : file_(dir_ / "trace.log")
{
    TRC1_Configure(flags, file_.c_str());
}

TraceCapture::~TraceCapture()
{
    TRC1_Configure(0, nullptr);
}

std::string TraceCapture::text() const
{
    std::ifstream in(file_, std::ios::binary);
    std::ostringstream s;
    s << in.rdbuf();
    return s.str();
}

size_t TraceCapture::count(const std::string &needle) const
{
    std::string t = text();
    size_t n = 0;
    for (size_t pos = t.find(needle); pos != std::string::npos; pos = t.find(needle, pos + needle.size()))
        ++n;
    return n;
}

std::string bin_dir()
{
    const char *dir = std::getenv("DPX_BIN_DIR");
    return dir != nullptr ? dir : "";
}

}  // namespace dpxtest
