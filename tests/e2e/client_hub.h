// This test process as a client of a hub that runs as a separate process.
#ifndef DPX_TEST_CLIENT_HUB_H
#define DPX_TEST_CLIENT_HUB_H

#include "process.h"
#include "test_support.h"

#include "dpx/dpx.h"
#include "trc/trc1.h"

#include <gtest/gtest.h>

#include <csignal>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <sys/wait.h>
#include <vector>

namespace dpxtest {

inline std::string made_dir(const std::string &path)
{
    std::filesystem::create_directories(path);
    return path;
}

// A hub (dpx-agentd, or the test peer) serving product "prod" from a depot in
// a fresh directory, and this process set up as its client: DPX_HUBHOST and
// the broker port point at it, temporary files go to a directory of the
// test's own, and the library is started. The end stops the library, which
// drops the cached binding, so the next hub is looked up afresh.
struct ClientOfHub {
    explicit ClientOfHub(std::vector<std::string> extra = {}, std::string program = "dpx-agentd",
                         uint16_t broker_port = 0)
        : extra(std::move(extra)), program(std::move(program)), broker_port(broker_port),
          daemon(std::make_unique<Daemon>(depot, "prod", this->extra, this->program, broker_port)),
          lb_port("NCS_LB_PORT", std::to_string(daemon->lb_port)), tmpdir("TMPDIR", tmp)
    {
        dpx_agent_init();
    }
    ~ClientOfHub() { dpx_agent_stop(); }
    ClientOfHub(const ClientOfHub &) = delete;
    ClientOfHub &operator=(const ClientOfHub &) = delete;

    // Stops the hub and starts it anew, on another port. REQUIRES: a broker
    // of its own, `broker_port`.
    void restart()
    {
        EXPECT_EQ(daemon->stop(), 0);
        daemon = std::make_unique<Daemon>(depot, "prod", extra, program, broker_port);
    }

    std::string depot_file(const std::string &path) const { return depot + "/prod/" + path; }
    std::vector<std::string> temp_files() const { return files_with_prefix(tmp, "cxp"); }
    // Lines of the test peer's output that start with `prefix`, counted after
    // it has been stopped, so that none is still on its way.
    size_t peer_lines(const std::string &prefix)
    {
        daemon->stop();
        return daemon->process->count_lines(prefix);
    }

    TempDir dir;
    const std::string depot = made_dir(dir / "depot");
    const std::string tmp = made_dir(dir / "tmp");
    const std::vector<std::string> extra;
    const std::string program;
    const uint16_t broker_port;
    std::unique_ptr<Daemon> daemon;
    ScopedEnv hub_host{"DPX_HUBHOST", "127.0.0.1"};
    ScopedEnv framework_host{"AFW_HUB_HOST", std::nullopt};
    ScopedEnv lb_port;
    ScopedEnv tmpdir;
};

// Empty when the two files have the same bytes, else where they differ.
// Reads both in blocks, so any size can be compared.
inline std::string compare_files(const std::string &a, const std::string &b)
{
    std::ifstream in_a(a, std::ios::binary), in_b(b, std::ios::binary);
    if (!in_a || !in_b)
        return "cannot open " + (in_a ? b : a);
    std::vector<char> block_a(1 << 20), block_b(1 << 20);
    for (uint64_t offset = 0;; offset += static_cast<uint64_t>(in_a.gcount())) {
        in_a.read(block_a.data(), static_cast<std::streamsize>(block_a.size()));
        in_b.read(block_b.data(), static_cast<std::streamsize>(block_b.size()));
        if (in_a.gcount() != in_b.gcount())
            return "lengths differ after " + std::to_string(offset);
        if (std::memcmp(block_a.data(), block_b.data(), static_cast<size_t>(in_a.gcount())) != 0)
            return "bytes differ in the block at " + std::to_string(offset);
        if (in_a.gcount() == 0)
            return "";
    }
}

inline bool exited_with(int wstatus, int code)
{
    return wstatus != -1 && WIFEXITED(wstatus) && WEXITSTATUS(wstatus) == code;
}

}  // namespace dpxtest

#endif
