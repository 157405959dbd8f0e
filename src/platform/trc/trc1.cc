#include "trc/trc1.h"

#include "plt/plt1.h"

#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <mutex>
#include <string>
#include <sys/syscall.h>
#include <unistd.h>

volatile uint32_t TRC1_SyncWord = 1;

namespace {

struct Config {
    std::mutex mutex;           // guards everything below
    bool loaded = false;
    uint32_t flags = 0;
    std::string file;           // empty: standard error
    FILE *out = nullptr;        // open stream for `file`, or null
};

Config &config()
{
    static Config *c = new Config;  // lives as long as the process; traced code may run at exit
    return *c;
}


void close_out(Config &c)
{
    if (c.out != nullptr)
        std::fclose(c.out);
    c.out = nullptr;
}

void bump_sync()
{
    __atomic_fetch_add(&TRC1_SyncWord, 1, __ATOMIC_ACQ_REL);
}

// REQUIRES: c.mutex held.
void load_locked(Config &c)
{
    if (c.loaded)
        return;
    c.flags = PLT1_GetEnvNumber("TRC1_FLAGS", 0, UINT32_MAX, 0);
    const char *file = PLT1_GetEnv("TRC1_FILE", nullptr);
    close_out(c);
    c.file = file != nullptr ? file : "";
    c.loaded = true;
}

void write_line(TRC1_DESC *desc, int line, const char *text)
{
    struct timespec ts;
    clock_gettime(CLOCK_REALTIME, &ts);
    struct tm tm;
    gmtime_r(&ts.tv_sec, &tm);
    char stamp[64];
    std::snprintf(stamp, sizeof stamp, "%04d-%02d-%02dT%02d:%02d:%02d.%06ldZ", tm.tm_year + 1900, tm.tm_mon + 1,
                  tm.tm_mday, tm.tm_hour, tm.tm_min, tm.tm_sec, ts.tv_nsec / 1000);
    size_t len = std::strlen(text);
    while (len > 0 && text[len - 1] == '\n')
        --len;
    const char *unit = desc->unit != nullptr && desc->unit->name != nullptr ? desc->unit->name : "?";
    const char *function = desc->function != nullptr ? desc->function : "?";

    Config &c = config();
    std::lock_guard<std::mutex> hold(c.mutex);
    load_locked(c);
    FILE *out = stderr;
    if (!c.file.empty()) {
        if (c.out == nullptr)
            c.out = std::fopen(c.file.c_str(), "a");
        if (c.out == nullptr)
            return;
        out = c.out;
    }
    std::fprintf(out, "%s pid %ld tid %ld %s %s:%d %.*s\n", stamp, static_cast<long>(getpid()),
                 static_cast<long>(syscall(SYS_gettid)), unit, function, line, static_cast<int>(len), text);
    std::fflush(out);
}

}  // namespace

extern "C" {

uint32_t TRC1_Sync(TRC1_DESC *desc)
{
    Config &c = config();
    uint32_t stamp;
    uint32_t flags;
    {
        std::lock_guard<std::mutex> hold(c.mutex);
        load_locked(c);
        stamp = __atomic_load_n(&TRC1_SyncWord, __ATOMIC_ACQUIRE);
        flags = c.flags;
    }
    if (desc != nullptr) {
        __atomic_store_n(&desc->flags, flags, __ATOMIC_RELAXED);
        __atomic_store_n(&desc->stamp, stamp, __ATOMIC_RELEASE);
    }
    return flags;
}

void TRC1_Event(TRC1_DESC *desc, int line, int code, ...)
{
    if (desc == nullptr)
        return;
    char text[64];
    if (code == TRC1_EVENT_ENTRY) {
        std::snprintf(text, sizeof text, "ENTER");
    } else if (code == TRC1_EVENT_RESULT) {
        va_list ap;
        va_start(ap, code);
        long result = va_arg(ap, long);
        va_end(ap);
        std::snprintf(text, sizeof text, "EXIT result=%ld", result);
    } else {
        std::snprintf(text, sizeof text, "EXIT");
    }
    write_line(desc, line, text);
}

void TRC1_Printf(TRC1_DESC *desc, int line, const char *format, ...)
{
    if (desc == nullptr || format == nullptr)
        return;
    char small[512];
    va_list ap;
    va_start(ap, format);
    int n = std::vsnprintf(small, sizeof small, format, ap);
    va_end(ap);
    if (n < 0)
        return;
    if (static_cast<size_t>(n) < sizeof small) {
        write_line(desc, line, small);
        return;
    }
    std::string big(static_cast<size_t>(n) + 1, '\0');
    va_start(ap, format);
    std::vsnprintf(big.data(), big.size(), format, ap);
    va_end(ap);
    write_line(desc, line, big.c_str());
}

void TRC1_Configure(uint32_t flags, const char *file)
{
    Config &c = config();
    {
        std::lock_guard<std::mutex> hold(c.mutex);
        close_out(c);
        c.flags = flags;
        c.file = file != nullptr ? file : "";
        c.loaded = true;
    }
    bump_sync();
}

void TRC1_Reload(void)
{
    Config &c = config();
    {
        std::lock_guard<std::mutex> hold(c.mutex);
        c.loaded = false;
        load_locked(c);
    }
    bump_sync();
}

uint32_t TRC1_Flags(void)
{
    Config &c = config();
    std::lock_guard<std::mutex> hold(c.mutex);
    load_locked(c);
    return c.flags;
}

}  // extern "C"
