// Programs of the project run by a test as separate processes.
#ifndef DPX_TEST_PROCESS_H
#define DPX_TEST_PROCESS_H

#include "test_support.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <arpa/inet.h>
#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <csignal>
#include <fcntl.h>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <sys/socket.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>
#include <vector>

extern char **environ;

namespace dpxtest {

// Variables added to the test's environment for a program; nullopt removes one.
using Env = std::map<std::string, std::optional<std::string>>;

// A running program: standard output read line by line, standard error to
// `stderr_file` (or inherited). Killed and reaped at the end.
class Process {
public:
    Process(std::vector<std::string> argv, const Env &env = {}, const std::string &stderr_file = "")
    {
        // Everything the child needs is built before fork: no allocation after it.
        std::vector<std::string> env_strings;
        for (char **e = environ; *e != nullptr; ++e)
            if (env.count(std::string(*e).substr(0, std::string(*e).find('='))) == 0)
                env_strings.push_back(*e);
        for (const auto &[name, value] : env)
            if (value)
                env_strings.push_back(name + "=" + *value);
        std::vector<char *> envp, args;
        for (auto &s : env_strings)
            envp.push_back(s.data());
        for (auto &a : argv)
            args.push_back(a.data());
        envp.push_back(nullptr);
        args.push_back(nullptr);
        int pipefd[2];
        if (pipe2(pipefd, O_CLOEXEC) != 0) {
            ADD_FAILURE() << "pipe failed";
            return;
        }
        int err_fd = stderr_file.empty() ? -1
                                         : open(stderr_file.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
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
        out_fd_ = pipefd[0];
        EXPECT_GT(pid_, 0) << "fork failed";
        reader_ = std::thread([this] {
            std::string partial;
            char buf[4096];
            ssize_t n;
            while ((n = read(out_fd_, buf, sizeof buf)) > 0 || (n < 0 && errno == EINTR)) {
                partial.append(buf, static_cast<size_t>(std::max<ssize_t>(n, 0)));
                std::lock_guard<std::mutex> hold(mutex_);
                for (size_t nl; (nl = partial.find('\n')) != std::string::npos; partial.erase(0, nl + 1))
                    lines_.push_back(partial.substr(0, nl));
                changed_.notify_all();
            }
            std::lock_guard<std::mutex> hold(mutex_);
            if (!partial.empty())
                lines_.push_back(partial);
            eof_ = true;
            changed_.notify_all();
        });
    }
    ~Process()
    {
        signal(SIGKILL);
        wait();
        if (reader_.joinable())
            reader_.join();
        if (out_fd_ >= 0)
            close(out_fd_);
    }
    Process(const Process &) = delete;
    Process &operator=(const Process &) = delete;

    pid_t pid() const { return pid_; }

    // The first line of output starting with `prefix`; nullopt if the output
    // ends or `timeout` passes first.
    std::optional<std::string> wait_line(const std::string &prefix,
                                         std::chrono::milliseconds timeout = std::chrono::seconds(20))
    {
        std::unique_lock<std::mutex> hold(mutex_);
        std::optional<std::string> found;
        changed_.wait_for(hold, timeout, [&] {
            for (const auto &line : lines_)
                if (line.rfind(prefix, 0) == 0)
                    return (found = line).has_value();
            return eof_;
        });
        return found;
    }

    std::vector<std::string> lines()
    {
        std::lock_guard<std::mutex> hold(mutex_);
        return lines_;
    }

    void signal(int signo)
    {
        if (pid_ > 0 && !reaped_)
            kill(pid_, signo);
    }

    // Waits for the end and the last line of output: the status as waitpid
    // gives it, or -1 when `timeout` passed (the program is then killed).
    int wait(std::chrono::milliseconds timeout = std::chrono::seconds(30))
    {
        auto deadline = std::chrono::steady_clock::now() + timeout;
        bool timed_out = false;
        while (pid_ > 0 && !reaped_) {
            timed_out = std::chrono::steady_clock::now() > deadline;
            if (timed_out)
                kill(pid_, SIGKILL);
            reaped_ = waitpid(pid_, &wstatus_, timed_out ? 0 : WNOHANG) == pid_;
            if (!reaped_)
                std::this_thread::sleep_for(std::chrono::milliseconds(10));
        }
        std::unique_lock<std::mutex> hold(mutex_);
        changed_.wait_until(hold, deadline, [&] { return eof_; });
        return timed_out ? -1 : wstatus_;
    }

private:
    pid_t pid_ = -1;
    int out_fd_ = -1;
    bool reaped_ = false;
    int wstatus_ = -1;
    std::thread reader_;
    std::mutex mutex_;
    std::condition_variable changed_;
    std::vector<std::string> lines_;
    bool eof_ = false;
};

// A program run to its end: exit status, standard output and error.
struct Ran {
    int wstatus;
    std::vector<std::string> out;
    std::string err;
};

inline Ran run(std::vector<std::string> argv, const Env &env = {},
               std::chrono::milliseconds timeout = std::chrono::seconds(30))
{
    TempDir dir;
    Process process(std::move(argv), env, dir / "stderr");
    int wstatus = process.wait(timeout);
    return {wstatus, process.lines(), read_file(dir / "stderr")};
}

inline bool exited_with(int wstatus, int code)
{
    return wstatus != -1 && WIFEXITED(wstatus) && WEXITSTATUS(wstatus) == code;
}

// The port of the first line "<prefix>HOST:PORT" of `process`; 0 if none came.
inline uint16_t listening_port(Process &process, const std::string &prefix = "listening on ")
{
    auto line = process.wait_line(prefix);
    return line ? static_cast<uint16_t>(std::stoi(line->substr(line->rfind(':') + 1))) : 0;
}

// A TCP port on 127.0.0.1 that was free a moment ago.
inline uint16_t free_port()
{
    int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_in addr{AF_INET, 0, {htonl(INADDR_LOOPBACK)}, {}};
    socklen_t len = sizeof addr;
    bool ok = bind(fd, reinterpret_cast<sockaddr *>(&addr), sizeof addr) == 0 &&
              getsockname(fd, reinterpret_cast<sockaddr *>(&addr), &len) == 0;
    close(fd);
    return ok ? ntohs(addr.sin_port) : 0;
}

}  // namespace dpxtest

#endif
