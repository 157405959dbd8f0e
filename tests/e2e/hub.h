// The end-to-end suites' hub: a location broker (dpx-lbd) and a hub daemon
// (dpx-agentd, or the test peer) registered in it, serving product "prod"
// from a fresh depot. This process, and every program it starts, is their
// client: DPX_HUBHOST and the broker port point at them, temporary files go
// to a directory of the test's own, and the library runs.
#ifndef DPX_E2E_HUB_H
#define DPX_E2E_HUB_H

#include "process.h"

#include "dpx/dpx.h"
#include "trc/trc1.h"

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <memory>

namespace dpxtest {

inline std::string made_dir(const std::string &path)
{
    std::filesystem::create_directories(path);
    return path;
}

inline bool same_files(const std::string &a, const std::string &b)
{
    std::ifstream x(a, std::ios::binary), y(b, std::ios::binary);
    return x && y && std::equal(std::istreambuf_iterator<char>(x), {}, std::istreambuf_iterator<char>(y), {});
}

inline bool slow_skipped()
{
    return std::getenv("DPX_SKIP_SLOW") != nullptr;
}

struct Hub {
    explicit Hub(std::vector<std::string> args = {}, std::string program = "dpx-agentd") : program(std::move(program))
    {
        made_dir(depot + "/prod");
        start(std::move(args));
        dpx_agent_init();
    }
    // Stopping the library drops the cached binding: the next hub is looked up afresh.
    ~Hub() { dpx_agent_stop(); }
    Hub(const Hub &) = delete;
    Hub &operator=(const Hub &) = delete;

    // A new daemon, once the one before has ended; it listens on a new port.
    void start(std::vector<std::string> args = {})
    {
        std::vector<std::string> argv = {bin_dir() + "/" + program, "--depot", depot, "--product", "prod", "--hub"};
        argv.insert(argv.end(), args.begin(), args.end());
        daemon = std::make_unique<Process>(argv);
        port = listening_port(*daemon);
        EXPECT_NE(port, 0) << program << " did not start";
    }
    int stop()
    {
        daemon->signal(SIGTERM);
        return daemon->wait();
    }
    // Lines of the test peer's output that start with `prefix`, counted once
    // it has stopped, so that none is still on its way.
    size_t peer_lines(const std::string &prefix)
    {
        stop();
        auto lines = daemon->lines();
        return std::count_if(lines.begin(), lines.end(), [&](const auto &l) { return l.rfind(prefix, 0) == 0; });
    }
    std::string operator/(const std::string &name) const { return dir / name; }
    std::string depot_file(const std::string &path) const { return depot + "/prod/" + path; }
    std::vector<std::string> temp_files() const { return files_with_prefix(tmp, "cxp"); }

    const std::string program;
    TempDir dir;
    const std::string depot = made_dir(dir / "depot");
    const std::string tmp = made_dir(dir / "tmp");
    ScopedEnv hub_host{"DPX_HUBHOST", "127.0.0.1"}, framework_host{"AFW_HUB_HOST", std::nullopt}, tmpdir{"TMPDIR", tmp};
    std::unique_ptr<Process> broker = std::make_unique<Process>(std::vector<std::string>{bin_dir() + "/dpx-lbd"},
                                                                Env{{"NCS_LB_PORT", "0"}});
    const uint16_t broker_port = listening_port(*broker);
    ScopedEnv lb_port{"NCS_LB_PORT", std::to_string(broker_port)};
    std::unique_ptr<Process> daemon;
    uint16_t port = 0;
};

// What a process holds, as /proc tells it.
struct Resources {
    size_t files = 0, sockets = 0, threads = 0, rss_kib = 0;
};

// Of this process when `pid` is 0.
inline Resources resources_of(pid_t pid)
{
    namespace fs = std::filesystem;
    const std::string proc = "/proc/" + (pid != 0 ? std::to_string(pid) : "self");
    Resources r;
    std::error_code ec;
    for (const auto &entry : fs::directory_iterator(proc + "/fd", ec)) {
        std::string target = fs::read_symlink(entry.path(), ec).string();
        // The event objects of a connection's io_context go with its socket.
        r.sockets += target.rfind("socket:", 0) == 0;
        r.files += target.rfind("socket:", 0) != 0 && target.rfind("anon_inode:", 0) != 0;
    }
    for (auto it = fs::directory_iterator(proc + "/task", ec); !ec && it != fs::directory_iterator(); ++it)
        ++r.threads;
    std::ifstream status(proc + "/status");
    for (std::string line; std::getline(status, line);)
        if (line.rfind("VmRSS:", 0) == 0)
            r.rss_kib = std::stoul(line.substr(6));
    return r;
}

// For what another process finishes in its own time: polls `done` for about 10 s.
template <class Done>
bool eventually(Done done)
{
    for (int i = 0; i < 200 && !done(); ++i)
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
    return done();
}

}  // namespace dpxtest

#endif
