// GetFile calls one after the other in one process, through the C API, and
// the files per second they reach: what a caller that fetches many small
// files pays per file once the binding is cached.
//
//   getfile_loop NODE PATH TARGET [COUNT]
//
// The hub is found as by every client (DPX_HUBHOST, NCS_LB_PORT). COUNT
// defaults to 2000. Call i fetches into "TARGET.i", a new file each time, as
// a caller that fetches many files does; the copies are removed at the end,
// TARGET keeps the last. (Fetched over one existing file again and again, the
// time goes to ext4, which writes a file out to disk when it is renamed over
// another.) Prints one line: "getfile_loop COUNT files in S s: R files/s".
// Exits 1 at the first call that fails, with its status.
#include "dpx/dpx.h"

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string>

namespace {

// Starts and stops the library around the calls.
class Library {
public:
    Library() { dpx_agent_init(); }
    ~Library() { dpx_agent_stop(); }
    Library(const Library &) = delete;
    Library &operator=(const Library &) = delete;
};

}  // namespace

int main(int argc, char **argv)
{
    if (argc < 4 || argc > 5) {
        std::fprintf(stderr, "usage: getfile_loop NODE PATH TARGET [COUNT]\n");
        return 2;
    }
    const long count = argc == 5 ? std::strtol(argv[4], nullptr, 10) : 2000;
    if (count <= 0) {
        std::fprintf(stderr, "getfile_loop: COUNT must be a positive number\n");
        return 2;
    }
    Library library;
    const std::string target = argv[3];
    // The first call binds to the hub; it is not counted.
    dpx_status status = GetFile(argv[1], argv[2], target.c_str());
    const auto start = std::chrono::steady_clock::now();
    long done = 0;
    for (; done < count && status == DPX_OK; ++done)
        status = GetFile(argv[1], argv[2], (target + "." + std::to_string(done)).c_str());
    const double seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
    std::error_code ignored;
    for (long i = 0; i < done; ++i)
        std::filesystem::remove(target + "." + std::to_string(i), ignored);
    if (status != DPX_OK) {
        std::fprintf(stderr, "getfile_loop: GetFile failed: 0x%08X\n", status);
        return 1;
    }
    std::printf("getfile_loop %ld files in %.3f s: %.0f files/s\n", count, seconds, count / seconds);
    return 0;
}
