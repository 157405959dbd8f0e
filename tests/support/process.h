// A program of the project run as a separate process by a test: started with
// its own environment, its standard output read line by line, stopped with a
// signal, always reaped.
#ifndef DPX_TEST_PROCESS_H
#define DPX_TEST_PROCESS_H

#include <chrono>
#include <condition_variable>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <sys/types.h>
#include <thread>
#include <vector>

namespace dpxtest {

class Process {
public:
    // Starts `argv[0]` (a path) with the arguments; `env` is added to the
    // test's environment (a nullopt value removes the variable). Standard error
    // goes to `stderr_file` when given, else is inherited.
    Process(std::vector<std::string> argv, std::map<std::string, std::optional<std::string>> env = {},
            std::string stderr_file = "");
    ~Process();  // SIGKILL if still running, then reap
    Process(const Process &) = delete;
    Process &operator=(const Process &) = delete;

    pid_t pid() const { return pid_; }
    // Waits up to `timeout` for a line of standard output starting with
    // `prefix`; returns it, or nullopt.
    std::optional<std::string> wait_line(const std::string &prefix,
                                         std::chrono::milliseconds timeout = std::chrono::seconds(20));
    // All lines so far.
    std::vector<std::string> lines();
    // Number of lines so far that start with `prefix`.
    size_t count_lines(const std::string &prefix);
    void signal(int signo);
    // Waits for the end and for the last line of its output; returns the exit
    // status as waitpid gives it, or -1 on a time-out (the process is then
    // killed).
    int wait(std::chrono::milliseconds timeout = std::chrono::seconds(30));
    bool running();

private:
    void reader();

    pid_t pid_ = -1;
    int out_fd_ = -1;
    bool reaped_ = false;
    int wstatus_ = 0;
    std::thread reader_;
    std::mutex mutex_;
    std::condition_variable changed_;
    std::vector<std::string> lines_;
    bool eof_ = false;
};

// A dpx-agentd (or the test peer, with `program`) on 127.0.0.1, registered as
// the hub: with its own broker at a free port, or, given `broker_port`, in the
// broker that runs there. `port` is where it listens, `lb_port` the broker.
struct Daemon {
    Daemon(const std::string &depot, const std::string &product, std::vector<std::string> extra = {},
           const std::string &program = "dpx-agentd", uint16_t broker_port = 0);
    // Stops it with SIGTERM; its exit status as waitpid gives it.
    int stop();
    std::unique_ptr<Process> process;
    uint16_t port = 0;
    uint16_t lb_port = 0;
};

// A TCP port on 127.0.0.1 that was free a moment ago.
uint16_t free_port();

}  // namespace dpxtest

#endif
