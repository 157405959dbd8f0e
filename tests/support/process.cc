#include "process.h"

#include "test_support.h"

#include <gtest/gtest.h>

#include <arpa/inet.h>
#include <cerrno>
#include <csignal>
#include <cstring>
#include <fcntl.h>
#include <memory>
#include <netinet/in.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

extern char **environ;

namespace dpxtest {

Process::Process(std::vector<std::string> argv, std::map<std::string, std::optional<std::string>> env,
                 std::string stderr_file)
{
    int pipefd[2];
    if (pipe2(pipefd, O_CLOEXEC) != 0) {
        ADD_FAILURE() << "pipe: " << std::strerror(errno);
        return;
    }
    // Build the child's environment before fork: no allocation after it.
    std::map<std::string, std::string> merged;
    for (char **e = environ; *e != nullptr; ++e) {
        std::string entry = *e;
        size_t eq = entry.find('=');
        if (eq != std::string::npos)
            merged[entry.substr(0, eq)] = entry.substr(eq + 1);
    }
    for (const auto &[name, value] : env) {
        if (value)
            merged[name] = *value;
        else
            merged.erase(name);
    }
    std::vector<std::string> env_strings;
    for (const auto &[name, value] : merged)
        env_strings.push_back(name + "=" + value);
    std::vector<char *> envp;
    for (auto &s : env_strings)
        envp.push_back(s.data());
    envp.push_back(nullptr);
    std::vector<char *> args;
    for (auto &a : argv)
        args.push_back(a.data());
    args.push_back(nullptr);
    int err_fd = -1;
    if (!stderr_file.empty())
        err_fd = open(stderr_file.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);

    pid_ = fork();
    if (pid_ == 0) {
        dup2(pipefd[1], STDOUT_FILENO);
        if (err_fd >= 0)
            dup2(err_fd, STDERR_FILENO);
        execve(args[0], args.data(), envp.data());
        _exit(127);
    }
    close(pipefd[1]);
    if (err_fd >= 0)
        close(err_fd);
    if (pid_ < 0) {
        close(pipefd[0]);
        ADD_FAILURE() << "fork: " << std::strerror(errno);
        return;
    }
    out_fd_ = pipefd[0];
    reader_ = std::thread([this] { reader(); });
}

Process::~Process()
{
    if (pid_ > 0 && !reaped_) {
        kill(pid_, SIGKILL);
        wait(std::chrono::seconds(10));
    }
    if (reader_.joinable())
        reader_.join();
    if (out_fd_ >= 0)
        close(out_fd_);
}

void Process::reader()
{
    std::string partial;
    char buf[4096];
    for (;;) {
        ssize_t n = read(out_fd_, buf, sizeof buf);
        if (n < 0 && errno == EINTR)
            continue;
        if (n <= 0)
            break;
        partial.append(buf, static_cast<size_t>(n));
        size_t nl;
        while ((nl = partial.find('\n')) != std::string::npos) {
            std::lock_guard<std::mutex> hold(mutex_);
            lines_.push_back(partial.substr(0, nl));
            partial.erase(0, nl + 1);
            changed_.notify_all();
        }
    }
    std::lock_guard<std::mutex> hold(mutex_);
    if (!partial.empty())
        lines_.push_back(partial);
    eof_ = true;
    changed_.notify_all();
}

std::optional<std::string> Process::wait_line(const std::string &prefix, std::chrono::milliseconds timeout)
{
    std::unique_lock<std::mutex> hold(mutex_);
    std::optional<std::string> found;
    changed_.wait_for(hold, timeout, [&] {
        for (const auto &line : lines_) {
            if (line.rfind(prefix, 0) == 0) {
                found = line;
                return true;
            }
        }
        return eof_;
    });
    return found;
}

std::vector<std::string> Process::lines()
{
    std::lock_guard<std::mutex> hold(mutex_);
    return lines_;
}

size_t Process::count_lines(const std::string &prefix)
{
    std::lock_guard<std::mutex> hold(mutex_);
    size_t n = 0;
    for (const auto &line : lines_)
        n += line.rfind(prefix, 0) == 0 ? 1 : 0;
    return n;
}

void Process::signal(int signo)
{
    if (pid_ > 0 && !reaped_)
        kill(pid_, signo);
}

bool Process::running()
{
    if (pid_ <= 0 || reaped_)
        return false;
    int status = 0;
    pid_t r = waitpid(pid_, &status, WNOHANG);
    if (r == pid_) {
        reaped_ = true;
        wstatus_ = status;
        return false;
    }
    return true;
}

int Process::wait(std::chrono::milliseconds timeout)
{
    if (pid_ <= 0)
        return -1;
    auto deadline = std::chrono::steady_clock::now() + timeout;
    while (!reaped_) {
        int status = 0;
        pid_t r = waitpid(pid_, &status, WNOHANG);
        if (r == pid_) {
            reaped_ = true;
            wstatus_ = status;
            break;
        }
        if (std::chrono::steady_clock::now() > deadline) {
            kill(pid_, SIGKILL);
            waitpid(pid_, &status, 0);
            reaped_ = true;
            wstatus_ = status;
            return -1;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    std::unique_lock<std::mutex> hold(mutex_);
    changed_.wait_until(hold, deadline, [&] { return eof_; });
    return wstatus_;
}

uint16_t free_port()
{
    int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_in addr{};
    addr.sin_family = AF_INET;
    addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    addr.sin_port = 0;
    socklen_t len = sizeof addr;
    uint16_t port = 0;
    if (fd >= 0 && bind(fd, reinterpret_cast<sockaddr *>(&addr), sizeof addr) == 0 &&
        getsockname(fd, reinterpret_cast<sockaddr *>(&addr), &len) == 0)
        port = ntohs(addr.sin_port);
    if (fd >= 0)
        close(fd);
    return port;
}

Daemon::Daemon(const std::string &depot, const std::string &product, std::vector<std::string> extra,
               const std::string &program, uint16_t broker_port)
{
    // A broker port of its own may have been taken between free_port and the
    // start: try a few.
    for (int attempt = 0; attempt < 5 && port == 0; ++attempt) {
        lb_port = broker_port != 0 ? broker_port : free_port();
        std::vector<std::string> argv = {bin_dir() + "/" + program, "--depot", depot, "--product", product, "--hub"};
        if (broker_port == 0)
            argv.push_back("--broker");
        argv.insert(argv.end(), extra.begin(), extra.end());
        process = std::make_unique<Process>(argv,
                                            std::map<std::string, std::optional<std::string>>{
                                                {"NCS_LB_PORT", std::to_string(lb_port)}});
        auto line = process->wait_line("listening on ");
        if (!line)
            continue;
        size_t colon = line->rfind(':');
        port = static_cast<uint16_t>(std::stoi(line->substr(colon + 1)));
    }
    EXPECT_NE(port, 0) << program << " did not start";
}

int Daemon::stop()
{
    process->signal(SIGTERM);
    return process->wait();
}

}  // namespace dpxtest
