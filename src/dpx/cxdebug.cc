// What every cx_ operation shares: the status record and its helpers, and
// the layer's own debugging log "/dpx-debug.log", which is apart from the
// tracing of the rest of the library.
#include "cxfile.h"

#include <atomic>
#include <cerrno>
#include <cstdarg>
#include <cstdio>

namespace {

// Current indentation of the log in columns, one counter for the whole
// process and all its threads. Enter raises it and Leave lowers it by
// kIndentStep; an unbalanced Leave takes it below zero, where lines get no
// blanks, and later calls count on from there.
std::atomic<int32_t> CX_INTERNAL_TRACE_INDENT{0};
constexpr int32_t kIndentStep = 3;

// The log lies in the root directory, whatever the process's settings.
FILE *CX_OPEN_LOGFILE()
{
    return std::fopen("/dpx-debug.log", "a");
}

// Flushes and closes: every entry is in the file when its call returns. A
// failure has nowhere to be reported.
void CX_CLOSE_LOGFILE(FILE *stream)
{
    std::fflush(stream);
    std::fclose(stream);
}

enum class TraceKind { enter, leave, point };

// One entry: blanks for the indentation, the marker, then the caller's text
// as it stands, with no newline added. Where the log can't be opened the call
// does nothing at all, the counter included.
void write_trace(TraceKind kind, const char *format, va_list args)
{
    FILE *log = CX_OPEN_LOGFILE();
    if (log == nullptr)
        return;
    int32_t indent = 0;
    const char *marker = "";
    switch (kind) {
    case TraceKind::enter:
        // The ENTER line stands at the outer level; what follows is indented.
        indent = CX_INTERNAL_TRACE_INDENT.fetch_add(kIndentStep);
        marker = "ENTER ";
        break;
    case TraceKind::leave:
        indent = CX_INTERNAL_TRACE_INDENT.fetch_sub(kIndentStep) - kIndentStep;
        marker = "LEAVE ";
        break;
    case TraceKind::point:
        indent = CX_INTERNAL_TRACE_INDENT.load();
        marker = "... ";
        break;
    }
    for (int32_t i = 0; i < indent; ++i)
        std::fputc(' ', log);
    std::fputs(marker, log);
    if (format != nullptr)
        std::vfprintf(log, format, args);
    CX_CLOSE_LOGFILE(log);
}

}  // namespace

extern "C" {

const cx_status CX_STATUS_SUCCESS = {CX_CATEGORY_OK, 0};

cx_status cx_posix_failure(int32_t code)
{
    return cx_status{CX_CATEGORY_POSIX, code};
}

cx_status cx_errno_failure(void)
{
    return cx_posix_failure(errno);
}

bool cx_succeeded(cx_status status)
{
    return status.category == CX_CATEGORY_OK;
}

void cxIntlTraceEnter(const char *format, ...)
{
    va_list args;
    va_start(args, format);
    write_trace(TraceKind::enter, format, args);
    va_end(args);
}

void cxIntlTraceLeave(const char *format, ...)
{
    va_list args;
    va_start(args, format);
    write_trace(TraceKind::leave, format, args);
    va_end(args);
}

void cxIntlTracePoint(const char *format, ...)
{
    va_list args;
    va_start(args, format);
    write_trace(TraceKind::point, format, args);
    va_end(args);
}

}  // extern "C"
