#include "test_support.h"

#include "child.h"

#include "trc/trc1.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <random>
#include <sstream>
#include <sys/wait.h>
#include <unistd.h>

namespace fs = std::filesystem;

namespace dpxtest {

TempDir::TempDir()
{
    const char *base = std::getenv("TMPDIR");
    std::string templ = std::string(base != nullptr && *base != '\0' ? base : "/tmp") + "/dpxtest.XXXXXX";
    EXPECT_NE(mkdtemp(templ.data()), nullptr) << "mkdtemp failed";
    path_ = templ;
}

TempDir::~TempDir()
{
    // Everything made removable first: tests take permissions away.
    std::error_code ec;
    for (auto it = fs::recursive_directory_iterator(path_, fs::directory_options::skip_permission_denied, ec);
         it != fs::recursive_directory_iterator(); it.increment(ec))
        fs::permissions(it->path(), fs::perms::owner_all, fs::perm_options::add, ec);
    fs::remove_all(path_, ec);
}

void write_file(const std::string &path, const std::string &bytes)
{
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    out.write(bytes.data(), static_cast<std::streamsize>(bytes.size()));
    EXPECT_TRUE(out.good()) << "cannot write " << path;
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
    for (char &c : out)
        c = static_cast<char>(gen() & 0xFF);
    return out;
}

std::vector<std::string> files_with_prefix(const std::string &dir, const std::string &prefix)
{
    std::vector<std::string> out;
    std::error_code ec;
    for (const auto &entry : fs::directory_iterator(dir, ec))
        if (entry.path().filename().string().rfind(prefix, 0) == 0)
            out.push_back(entry.path().string());
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
    write_file(file_, "");
    TRC1_Configure(flags, file_.c_str());
}

TraceCapture::~TraceCapture()
{
    TRC1_Configure(0, nullptr);
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

std::string in_child(const std::function<std::string()> &body)
{
    int pipefd[2];
    if (pipe(pipefd) != 0)
        return "pipe failed";
    pid_t pid = fork();
    if (pid == 0) {
        close(pipefd[0]);
        std::string failure = body();
        if (!failure.empty() && write(pipefd[1], failure.data(), failure.size()) < 0)
            _exit(2);
        _exit(failure.empty() ? 0 : 1);
    }
    close(pipefd[1]);
    std::string report;
    char buf[512];
    for (ssize_t n; (n = read(pipefd[0], buf, sizeof buf)) > 0;)
        report.append(buf, static_cast<size_t>(n));
    close(pipefd[0]);
    int wstatus = 0;
    if (pid < 0 || waitpid(pid, &wstatus, 0) != pid)
        return "fork failed";
    if (!WIFEXITED(wstatus))
        return "child died: " + report;
    return WEXITSTATUS(wstatus) != 0 && report.empty() ? "child failed" : report;
}

}  // namespace dpxtest
