// dpx: the client command line of libdpx. Fetches and stores files on the hub,
// sends queries, lists nodes, and tells what a status means.
#include "dpx/dpx.h"

#include <cctype>
#include <cmath>
#include <cstdint>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <mutex>
#include <optional>
#include <string>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>
#include <vector>

namespace {

const char kUsage[] =
    "usage: dpx [--quiet] get NODE PATH TARGET\n"
    "       dpx [--quiet] put NODE PATH SOURCE\n"
    "       dpx query NODE|- QUERY PATH\n"
    "       dpx list [FILTER]\n"
    "       dpx status CODE\n"
    "\n"
    "  get     fetch PATH of NODE from the depot into the local file TARGET; TARGET is\n"
    "          replaced only when the whole file has arrived\n"
    "  put     append the local file SOURCE to PATH of NODE in the depot\n"
    "  query   send QUERY with PATH to NODE (- for this node); prints the answer\n"
    "  list    print the names of the nodes the hub knows, one a line\n"
    "  status  print the text of a status CODE (hex like 0xF11E0004, or decimal)\n"
    "  --quiet no progress display (shown on a terminal for transfers above 8 MB)\n"
    "  --help  this text\n"
    "  --      what follows is not an option, even when it starts with -\n"
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
    "  NCS_TLS_CERT, NCS_TLS_KEY, NCS_TLS_CA  TLS to the hub: this client's certificate,\n"
    "                          its key and the CA that signed the hub's (see dpx-agentd)\n"
    "  TRC1_FLAGS, TRC1_FILE   tracing: flag mask and the file to append to\n";

constexpr uint64_t kProgressThreshold = 8ull << 20;

int usage_error(const std::string &message)
{
    std::fprintf(stderr, "dpx: %s\n%s", message.c_str(), kUsage);
    return 2;
}

// "0xF11E0004 cannot read file": a status in hex and its text.
std::string status_line(dpx_status status)
{
    char text[256];
    error__c_text(status, text, sizeof text);
    char line[300];
    std::snprintf(line, sizeof line, "0x%08X %s", status, text[0] != '\0' ? text : "(no text)");
    return line;
}

int report(dpx_status status)
{
    if (status == DPX_OK)
        return 0;
    std::fprintf(stderr, "%s\n", status_line(status).c_str());
    return 1;
}

// Bytes this process has moved through read() or write() calls, the line
// "rchar: N" or "wchar: N" of /proc/self/io. The runtime's socket calls don't
// count there, the file's do: an upload reads the source with read(), a
// download writes its temporary file with write().
uint64_t io_counter(const char *field)
{
    std::ifstream io("/proc/self/io");
    std::string name;
    uint64_t value = 0;
    while (io >> name >> value) {
        if (name == std::string(field) + ":")
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
// a transfer runs on another thread, once more than kProgressThreshold bytes
// have moved or are to move.
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
        if (shown_)
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
        if (total_ <= kProgressThreshold && moved <= kProgressThreshold)
            return;
        shown_ = true;
        double rate = seconds > 0 ? moved / seconds : 0;
        std::string line = "\r";
        line += human_bytes(static_cast<double>(moved));
        if (total_ > 0)
            line += " of " + human_bytes(static_cast<double>(total_));
        line += ", " + human_bytes(rate) + "/s";
        if (total_ > 0 && rate > 0)
            line += ", " + std::to_string(static_cast<long>(std::ceil((total_ - moved) / rate))) + " s left";
        std::fprintf(stderr, "%s\033[K", line.c_str());
        std::fflush(stderr);
    }

    const char *field_;
    uint64_t total_;
    uint64_t base_;
    std::mutex mutex_;
    std::condition_variable wake_;
    bool done_ = false;
    bool shown_ = false;
};

bool show_progress(bool quiet)
{
    return !quiet && isatty(STDERR_FILENO);
}

// The library's start and stop around the commands that reach the hub: the
// locks, and the retry settings from the environment.
struct Library {
    Library() { dpx_agent_init(); }
    ~Library() { dpx_agent_stop(); }
    Library(const Library &) = delete;
    Library &operator=(const Library &) = delete;
};

}  // namespace

int main(int argc, char **argv)
{
    std::vector<std::string> args;
    bool quiet = false;
    bool options_end = false;
    for (int i = 1; i < argc; ++i) {
        std::string arg = argv[i];
        // "-" names this node; a negative CODE is a number, not an option.
        bool option = !options_end && arg.size() > 1 && arg[0] == '-' &&
                      !(args.size() == 1 && args[0] == "status" && std::isdigit(static_cast<unsigned char>(arg[1])));
        if (!option) {
            args.push_back(arg);
        } else if (arg == "--") {
            options_end = true;
        } else if (arg == "--help" || arg == "-h") {
            std::fputs(kUsage, stdout);
            return 0;
        } else if (arg == "--quiet" || arg == "-q") {
            quiet = true;
        } else {
            return usage_error("unknown option " + arg);
        }
    }
    if (args.empty())
        return usage_error("no command");
    const std::string &command = args[0];
    size_t operands = args.size() - 1;
    std::optional<Library> library;
    if (command == "get" || command == "put" || command == "query" || command == "list")
        library.emplace();

    if (command == "get") {
        if (operands != 3)
            return usage_error("get wants NODE PATH TARGET");
        auto work = [&] { return GetFile(args[1].c_str(), args[2].c_str(), args[3].c_str()); };
        // The size is only known once the file has arrived: show bytes and rate.
        if (show_progress(quiet))
            return report(Progress("wchar", 0).run(work));
        return report(work());
    }
    if (command == "put") {
        if (operands != 3)
            return usage_error("put wants NODE PATH SOURCE");
        struct stat st;
        uint64_t size = stat(args[3].c_str(), &st) == 0 ? static_cast<uint64_t>(st.st_size) : 0;
        auto work = [&] { return PutFile(args[1].c_str(), args[2].c_str(), args[3].c_str()); };
        if (show_progress(quiet) && size > kProgressThreshold)
            return report(Progress("rchar", size).run(work));
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
        std::printf("%s\n", status_line(static_cast<uint32_t>(code)).c_str());
        return 0;
    }
    return usage_error("unknown command " + command);
}
