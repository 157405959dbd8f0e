#include "child.h"

#include <cstdio>
#include <string>
#include <sys/wait.h>
#include <unistd.h>

namespace dpxtest {

std::string in_child(const std::function<std::string()> &body)
{
    int pipefd[2];
    if (pipe(pipefd) != 0)
        return "pipe failed";
    pid_t pid = fork();
    if (pid < 0)
        return "fork failed";
    if (pid == 0) {
        close(pipefd[0]);
        std::string failure = body();
        if (!failure.empty()) {
            ssize_t ignored = write(pipefd[1], failure.data(), failure.size());
            (void)ignored;
        }
        _exit(failure.empty() ? 0 : 1);
    }
    close(pipefd[1]);
    std::string report;
    char buf[512];
    ssize_t n;
    while ((n = read(pipefd[0], buf, sizeof buf)) > 0)
        report.append(buf, static_cast<size_t>(n));
    close(pipefd[0]);
    int wstatus = 0;
    waitpid(pid, &wstatus, 0);
    if (!WIFEXITED(wstatus))
        return "child died: " + report;
    if (WEXITSTATUS(wstatus) != 0 && report.empty())
        return "child failed";
    return report;
}

}  // namespace dpxtest
