// dpx: the client command line of libdpx. Fetches and stores files on the hub,
// sends queries, lists nodes, and tells what a status means.
#include "dpx/dpx.h"

#include <cstdint>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <mutex>
#include <string>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>
#include <vector>

namespace {

const char kUsage[] =
    "usage: dpx [--quiet] get NODE PATH TARGET\n"
    "       dpx [--quiet] put NODE PATH SOURCE\n"
    "       dpx query NODE QUERY PATH\n"
    "       dpx list [FILTER]\n"
    "       dpx status CODE\n"
    "\n"
    "  get     fetch PATH of NODE from the depot into the local file TARGET; TARGET is\n"
    "          replaced only when the whole file has arrived\n"
    "  put     append the local file SOURCE to PATH of NODE in the depot\n"
    "  query   send QUERY with PATH to NODE; prints the answer\n"
    "  list    print the names of the nodes the hub knows, one a line\n"
    "  status  print the text of a status CODE (hex like 0xF11E0004, or decimal)\n"
    "  --quiet no progress display (shown on a terminal for transfers above 8 MB)\n"
    "  --help  this text\n"
    "\n"
    "Exit status: 0 on success; 1 on failure, with one line on standard error holding\n"
    "the status in hex and its text; 2 for a usage error.\n"
    "\n"
    "Environment:\n"
    "  AFW_HUB_HOST            host name of the hub (the agent framework's value)\n"
    "  DPX_HUBHOST             host name of the hub when the framework names none\n"
    "  NCS_LB_PORT             port of the location broker on the hub (default 135)\n"
    "  NCS_CONNECT_TIMEOUT_MS  connect time-out (default 5000)\n"
    "  NCS_CALL_TIMEOUT_MS     time-out of one call (default 120000)\n"
    "  DPX_MAX_RETRY           tries of a call while the hub is busy (default 6)\n"
    "  DPX_MIN_RETRY_INTERVAL  first sleep in seconds after a busy answer (default 3)\n"
    "  AFW_ORIGIN_NODE         this node's name, sent by query when NODE is -\n"
    "  TRC1_FLAGS, TRC1_FILE   tracing: flag mask and the file to append to\n";

constexpr uint64_t kProgressThreshold = 8ull << 20;

int usage_error(const std::string &message)
{
    std::fprintf(stderr, "dpx: %s\n%s", message.c_str(), kUsage);
    return 2;
}

int report(dpx_status status)
{
    if (status == DPX_OK)
        return 0;
    char text[256];
    error__c_text(status, text, sizeof text);
    std::fprintf(stderr, "dpx: failed: 0x%08X %s\n", status, text[0] != '\0' ? text : "(no text)");
    return 1;
}

// Bytes this process has moved through read() or write() calls: a download
// receives the file through its socket reads, an upload sends it through its
// socket writes.
uint64_t io_counter(const char *field)
{
    std::ifstream io("/proc/self/io");
    std::string name;
    uint64_t value = 0;
    while (io >> name >> value) {
        if (name == field)
            return value;
    }
    return 0;
}

std::string human_bytes(double bytes)
{
    const char *units[] = {"B", "KB", "MB", "GB", "TB"};
    int u = 0;
    while (bytes >= 1000.0 && u < 4) {
        bytes /= 1000.0;
        ++u;
    }
    char text[32];
    std::snprintf(text, sizeof text, "%.1f %s", bytes, units[u]);
    return text;
}

// Shows bytes, rate and (with a known total) time left on standard error while
// a transfer runs on another thread.
class Progress {
public:
    Progress(const char *field, uint64_t total) : field_(field), total_(total), base_(io_counter(field)) {}

    template <class Work>
    dpx_status run(Work &&work)
    {
        dpx_status status = DPX_OK;
        std::thread worker([&] {
            status = work();
            std::lock_guard<std::mutex> hold(mutex_);
            done_ = true;
            wake_.notify_all();
        });
        auto start = std::chrono::steady_clock::now();
        std::unique_lock<std::mutex> hold(mutex_);
        while (!wake_.wait_for(hold, std::chrono::milliseconds(500), [&] { return done_; }))
            show(start);
        hold.unlock();
        worker.join();
        std::fputs("\r\033[K", stderr);
        return status;
    }

private:
    void show(std::chrono::steady_clock::time_point start)
    {
        double seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
        uint64_t moved = io_counter(field_) - base_;
        if (total_ > 0 && moved > total_)
            moved = total_;
        double rate = seconds > 0 ? moved / seconds : 0;
        std::string line = "\r" + human_bytes(static_cast<double>(moved));
        if (total_ > 0)
            line += " of " + human_bytes(static_cast<double>(total_));
        line += ", " + human_bytes(rate) + "/s";
        if (total_ > 0 && rate > 0)
            line += ", " + std::to_string(static_cast<long>((total_ - moved) / rate)) + " s left";
        std::fprintf(stderr, "%s\033[K", line.c_str());
        std::fflush(stderr);
    }

    const char *field_;
    uint64_t total_;
    uint64_t base_;
    std::mutex mutex_;
    std::condition_variable wake_;
    bool done_ = false;
};

bool show_progress(bool quiet, uint64_t size)
{
    return !quiet && isatty(STDERR_FILENO) && size > kProgressThreshold;
}

}  // namespace

int main(int argc, char **argv)
{
    std::vector<std::string> args;
    bool quiet = false;
    for (int i = 1; i < argc; ++i) {
        std::string arg = argv[i];
        if (arg == "--help" || arg == "-h") {
            std::fputs(kUsage, stdout);
            return 0;
        }
        if (arg == "--quiet" || arg == "-q")
            quiet = true;
        else
            args.push_back(arg);
    }
    if (args.empty())
        return usage_error("no command");
    const std::string &command = args[0];
    size_t operands = args.size() - 1;

    if (command == "get") {
        if (operands != 3)
            return usage_error("get wants NODE PATH TARGET");
        auto work = [&] { return GetFile(args[1].c_str(), args[2].c_str(), args[3].c_str()); };
        // The size is only known once the file has arrived: show bytes and rate.
        if (show_progress(quiet, kProgressThreshold + 1))
            return report(Progress("rchar", 0).run(work));
        return report(work());
    }
    if (command == "put") {
        if (operands != 3)
            return usage_error("put wants NODE PATH SOURCE");
        struct stat st;
        uint64_t size = stat(args[3].c_str(), &st) == 0 ? static_cast<uint64_t>(st.st_size) : 0;
        auto work = [&] { return PutFile(args[1].c_str(), args[2].c_str(), args[3].c_str()); };
        if (show_progress(quiet, size))
            return report(Progress("wchar", size).run(work));
        return report(work());
    }
    if (command == "query") {
        if (operands != 3)
            return usage_error("query wants NODE QUERY PATH");
        uint32_t result = 0;
        const char *node = args[1] == "-" ? nullptr : args[1].c_str();
        dpx_status status = Query(node, args[2].c_str(), args[3].c_str(), &result);
        if (status == DPX_OK)
            std::printf("%u\n", result);
        return report(status);
    }
    if (command == "list") {
        if (operands > 1)
            return usage_error("list wants at most a FILTER");
        std::vector<dpx_node_name> nodes(128);
        int16_t last = -1;
        dpx_status status = ListNodes(operands == 1 ? args[1].c_str() : "", &last, 127, nodes.data());
        if (status == DPX_OK) {
            for (int16_t i = 0; i <= last && i < 128; ++i) {
                char name[DPX_NODE_LEN + 1] = {};
                std::memcpy(name, nodes[static_cast<size_t>(i)], DPX_NODE_LEN);
                std::printf("%s\n", name);
            }
        }
        return report(status);
    }
    if (command == "status") {
        if (operands != 1)
            return usage_error("status wants CODE");
        // Hex, decimal, or the negative form a Java caller sees.
        char *end = nullptr;
        long long code = std::strtoll(args[1].c_str(), &end, 0);
        if (end == args[1].c_str() || *end != '\0' || code < INT32_MIN || code > static_cast<long long>(UINT32_MAX))
            return usage_error("CODE must be a 32-bit number");
        auto status = static_cast<uint32_t>(code);
        char text[256];
        error__c_text(status, text, sizeof text);
        std::printf("0x%08X %s\n", status, text[0] != '\0' ? text : "(no text)");
        return 0;
    }
    return usage_error("unknown command " + command);
}
