// File access over stdio streams, and whole-file operations by path:
// temporary files, delete, move, copy.
#include "cxfile.h"

#include <cerrno>
#include <dlfcn.h>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <sys/types.h>

namespace {

// The copy buffer lies on the stack: no heap, whatever the file's size.
constexpr size_t kCopyBufferSize = 8192;

// The stdio mode of an open mode; null for a value that is none of them.
const char *stdio_mode(int32_t mode)
{
    switch (mode) {
    case CX_FILE_READ:
        return "rb";
    case CX_FILE_WRITE:
        return "wb";
    case CX_FILE_APPEND:
        return "ab";
    default:
        return nullptr;
    }
}

bool makes_directories(int32_t mode)
{
    return mode == CX_FILE_WRITE || mode == CX_FILE_APPEND;
}

}  // namespace

extern "C" {

cx_status cx_open_file(const char *path, cx_os_file_t *file, int32_t mode)
{
    cx_status status = CX_STATUS_SUCCESS;
    if (makes_directories(mode))
        status = cx_mkdirs_for_file(path);
    if (cx_succeeded(status))
        status = cx_open_posix_file(path, file, mode);
    return status;
}

cx_status cx_open_posix_file(const char *path, cx_os_file_t *file, int32_t mode)
{
    cx_status status = CX_STATUS_SUCCESS;
    if (path == nullptr || file == nullptr)
        return cx_posix_failure(EINVAL);
    const char *how = stdio_mode(mode);
    if (how == nullptr)
        return cx_posix_failure(EINVAL);
    file->stream = std::fopen(path, how);
    if (file->stream == nullptr)
        status = cx_errno_failure();
    return status;
}

cx_status cx_file_set_pos(cx_os_file_t *file, const uint64_t *position)
{
    cx_status status = CX_STATUS_SUCCESS;
    if (file == nullptr || position == nullptr)
        return cx_posix_failure(EINVAL);
    // off_t is 64 bits wide in this build: the whole position reaches the
    // seek. Past the end of the file is no failure.
    if (fseeko(file->stream, static_cast<off_t>(*position), SEEK_SET) != 0)
        status = cx_errno_failure();
    return status;
}

cx_status cx_file_read_bytes(cx_os_file_t *file, size_t count, size_t *done, void *buffer)
{
    cx_status status = CX_STATUS_SUCCESS;
    if (file == nullptr || done == nullptr || buffer == nullptr)
        return cx_posix_failure(EINVAL);
    auto *bytes = static_cast<unsigned char *>(buffer);
    size_t total = 0;
    size_t remaining = count;
    while (remaining > 0 && cx_succeeded(status)) {
        size_t got = std::fread(bytes + total, 1, remaining, file->stream);
        int error = errno;
        if (got < remaining && std::feof(file->stream)) {
            // The end of the file: a short count is the only sign of it.
            total += got;
            break;
        }
        if (got < remaining) {
            status = cx_posix_failure(error);
        } else {
            total += got;
            remaining -= got;
        }
    }
    if (cx_succeeded(status))
        *done = total;
    return status;
}

cx_status cx_file_write_bytes(cx_os_file_t *file, size_t count, size_t *done, const void *buffer)
{
    cx_status status = CX_STATUS_SUCCESS;
    if (file == nullptr || done == nullptr || buffer == nullptr)
        return cx_posix_failure(EINVAL);
    const auto *bytes = static_cast<const unsigned char *>(buffer);
    size_t total = 0;
    while (total < count && cx_succeeded(status)) {
        size_t put = std::fwrite(bytes + total, 1, count - total, file->stream);
        int error = errno;
        // A short write without the error indicator goes on with the rest.
        if (put < count - total && std::ferror(file->stream))
            status = cx_posix_failure(error);
        else
            total += put;
    }
    if (cx_succeeded(status))
        *done = total;
    return status;
}

cx_status cx_close_file(cx_os_file_t *file)
{
    cx_status status = CX_STATUS_SUCCESS;
    if (file == nullptr)
        return cx_posix_failure(EINVAL);
    // The stream is gone whatever fclose reports.
    if (std::fclose(file->stream) != 0)
        status = cx_errno_failure();
    return status;
}

namespace {

using TempnamFunction = char *(*)(const char *, const char *);

// The platform's tempnam, looked up when first needed instead of linked by
// name: the C library marks the name so that every link against it warns
// (it suggests mkstemp, which would open the file itself, with other
// permissions).
TempnamFunction platform_tempnam()
{
    static const TempnamFunction found = reinterpret_cast<TempnamFunction>(dlsym(RTLD_DEFAULT, "tempnam"));
    return found;
}

}  // namespace

cx_status cx_temp_file(const char *directory, char **name, cx_os_file_t *file)
{
    return cx_temp_posix_file(directory, name, file);
}

cx_status cx_temp_posix_file(const char *directory, char **name, cx_os_file_t *file)
{
    cx_status status = CX_STATUS_SUCCESS;
    if (name == nullptr || file == nullptr)
        return cx_posix_failure(EINVAL);
    *name = nullptr;
    // A null directory leaves the choice to the platform ("TMPDIR", then
    // P_tmpdir).
    TempnamFunction tempnam = platform_tempnam();
    if (tempnam == nullptr)
        return cx_posix_failure(ENOSYS);
    char *made = tempnam(directory, "cxp");
    if (made == nullptr)
        return cx_errno_failure();
    size_t size = std::strlen(made) + 1;
    *name = static_cast<char *>(std::malloc(size));
    if (*name == nullptr)
        status = cx_errno_failure();
    if (cx_succeeded(status)) {
        std::memcpy(*name, made, size);
        // Through cx_open_file, so a missing temporary directory is made.
        status = cx_open_file(*name, file, CX_FILE_WRITE);
    }
    std::free(made);
    return status;
}

cx_status cx_delete_file(const char *path)
{
    return cx_delete_posix_file(path);
}

cx_status cx_delete_posix_file(const char *path)
{
    cx_status status = CX_STATUS_SUCCESS;
    if (path == nullptr)
        return cx_posix_failure(EINVAL);
    // Files and empty directories alike.
    if (std::remove(path) != 0)
        status = cx_errno_failure();
    return status;
}

cx_status cx_move_file(const char *source, const char *destination)
{
    cx_status status = cx_mkdirs_for_file(destination);
    if (cx_succeeded(status))
        status = cx_move_posix_file(source, destination);
    return status;
}

cx_status cx_move_posix_file(const char *source, const char *destination)
{
    cx_status status = CX_STATUS_SUCCESS;
    if (source == nullptr || destination == nullptr)
        return cx_posix_failure(EINVAL);
    if (std::rename(source, destination) == 0)
        return status;
    int error = errno;
    // A copy takes over where a rename can't do the job: across file systems,
    // or where the rename reports a missing path although the source exists.
    cx_file_info_t info;
    bool copy = error == EXDEV || (error == ENOENT && cx_succeeded(cx_named_file_info(source, &info)) &&
                                   destination[0] != '\0');
    if (!copy)
        return cx_posix_failure(error);
    status = cx_copy_file(source, destination);
    // A source left beside a complete copy is no failure of the move.
    if (cx_succeeded(status))
        std::remove(source);
    return status;
}

cx_status cx_copy_file(const char *source, const char *destination)
{
    cx_status status = cx_mkdirs_for_file(destination);
    if (cx_succeeded(status))
        status = cx_copy_posix_file(source, destination);
    return status;
}

cx_status cx_copy_posix_file(const char *source, const char *destination)
{
    if (source == nullptr || destination == nullptr)
        return cx_posix_failure(EINVAL);
    cx_os_file_t in;
    cx_status status = cx_open_file(source, &in, CX_FILE_READ);
    bool in_open = cx_succeeded(status);
    cx_os_file_t out;
    bool out_open = false;
    if (in_open) {
        status = cx_open_file(destination, &out, CX_FILE_WRITE);
        out_open = cx_succeeded(status);
    }
    unsigned char buffer[kCopyBufferSize];
    size_t got = 0;
    while (out_open && cx_succeeded(status)) {
        status = cx_file_read_bytes(&in, sizeof buffer, &got, buffer);
        if (!cx_succeeded(status) || got == 0)
            break;
        size_t put = 0;
        status = cx_file_write_bytes(&out, got, &put, buffer);
    }
    // Only content is carried; the results of the closes are not looked at,
    // so a write failure delayed to the close goes unnoticed.
    if (out_open)
        cx_close_file(&out);
    if (in_open)
        cx_close_file(&in);
    return status;
}

}  // extern "C"
