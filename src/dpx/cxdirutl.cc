// Directories and file information: cutting a path into its levels, making
// the missing ones, and reading a file's size and modification time.
#include "cxfile.h"

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <sys/stat.h>

namespace {

// Permission bits of every directory made for a file: open to all users,
// whatever the umask.
constexpr uint32_t kFileDirMode = 0777;

bool dir_valid(const cx_dir_t *dir)
{
    return dir != nullptr && dir->length >= 0;
}

}  // namespace

extern "C" {

cx_status cx_dir_init(cx_dir_t *dir, const char *path)
{
    cx_status status = CX_STATUS_SUCCESS;
    if (dir == nullptr)
        return cx_posix_failure(EINVAL);
    dir->length = -1;
    dir->last_sep = -1;
    if (path == nullptr)
        return cx_posix_failure(EINVAL);
    // At most 255 characters with the NUL: a path of 255 characters doesn't
    // fit, and then the record stays not valid.
    for (int32_t i = 0; i < CX_DIR_PATH_SIZE - 1; ++i) {
        char c = path[i];
        if (c == '/' || c == '\\') {
            dir->path[i] = '/';
            dir->last_sep = i;
        } else {
            dir->path[i] = c;
            if (c == '\0') {
                dir->length = i;
                return status;
            }
        }
    }
    return cx_posix_failure(ENAMETOOLONG);
}

cx_status cx_dir_exists(const cx_dir_t *dir)
{
    cx_status status = CX_STATUS_SUCCESS;
    if (!dir_valid(dir))
        return cx_posix_failure(EINVAL);
    cx_file_info_t info;
    // Whatever made the query fail, the directory counts as missing.
    if (!cx_succeeded(cx_named_file_info(dir->path, &info)))
        status = cx_posix_failure(ENOENT);
    else if (!S_ISDIR(info.st_mode))
        status = cx_posix_failure(ENOTDIR);
    return status;
}

cx_status cx_dir_parent(const cx_dir_t *dir, cx_dir_t *parent)
{
    cx_status status = CX_STATUS_SUCCESS;
    if (!dir_valid(dir) || parent == nullptr)
        return cx_posix_failure(EINVAL);
    // A separator at index 0 or none at all: no parent, the empty record.
    int32_t length = dir->last_sep > 0 ? dir->last_sep : 0;
    std::memmove(parent->path, dir->path, static_cast<size_t>(length));
    parent->path[length] = '\0';
    parent->length = length;
    parent->last_sep = -1;
    for (int32_t i = length; i >= 1; --i) {
        if (parent->path[i] == '/') {
            parent->last_sep = i;
            break;
        }
    }
    return status;
}

cx_status cx_dir_mkdirs(const cx_dir_t *dir, uint32_t mode)
{
    if (!dir_valid(dir))
        return cx_posix_failure(EINVAL);
    // There already, or something else stands in the way.
    cx_status status = cx_dir_exists(dir);
    if (status.code != ENOENT)
        return status;
    cx_dir_t parent;
    status = cx_dir_parent(dir, &parent);
    // The levels are made from the top down; an empty parent is the top.
    if (cx_succeeded(status) && parent.length > 0)
        status = cx_dir_mkdirs(&parent, mode);
    if (cx_succeeded(status) && mkdir(dir->path, 0777) != 0)
        status = cx_errno_failure();
    // mkdir is subject to the umask: chmod sets the given mode exactly.
    if (cx_succeeded(status) && chmod(dir->path, static_cast<mode_t>(mode)) != 0)
        status = cx_errno_failure();
    return status;
}

cx_status cx_mkdirs_for_file(const char *path)
{
    if (path == nullptr)
        return cx_posix_failure(EINVAL);
    cx_dir_t file_dir;
    cx_dir_t parent;
    cx_status status = cx_dir_init(&file_dir, path);
    if (cx_succeeded(status))
        status = cx_dir_parent(&file_dir, &parent);
    // A bare name lies in the working directory and a name right under the
    // root in the root: both are there, nothing to make.
    if (cx_succeeded(status) && parent.length > 0)
        status = cx_dir_mkdirs(&parent, kFileDirMode);
    return status;
}

cx_status cx_named_file_info(const char *path, cx_file_info_t *info)
{
    cx_status status = CX_STATUS_SUCCESS;
    if (path == nullptr || info == nullptr)
        return cx_posix_failure(EINVAL);
#if defined(__USE_LARGEFILE64)
    if (stat64(path, info) != 0)
#else
    if (stat(path, info) != 0)
#endif
        status = cx_errno_failure();
    return status;
}

cx_status cx_file_info_size(const cx_file_info_t *info, uint64_t *size)
{
    cx_status status = CX_STATUS_SUCCESS;
    if (info == nullptr || size == nullptr)
        return cx_posix_failure(EINVAL);
    *size = static_cast<uint64_t>(info->st_size);
    return status;
}

cx_status cx_file_info_last_mod(const cx_file_info_t *info, int32_t *time)
{
    cx_status status = CX_STATUS_SUCCESS;
    if (info == nullptr || time == nullptr)
        return cx_posix_failure(EINVAL);
    // The seconds as a 32-bit count, as the records of the interface carry
    // them.
    *time = static_cast<int32_t>(info->st_mtime);
    return status;
}

cx_status cx_real_path(const char *path, char *real, size_t real_size)
{
    if (path == nullptr || real == nullptr)
        return cx_posix_failure(EINVAL);
    char head[PATH_MAX];
    size_t head_length = std::strlen(path);
    if (head_length >= sizeof head)
        return cx_posix_failure(ENAMETOOLONG);
    std::memcpy(head, path, head_length + 1);
    // Level by level from the end, until a leading part resolves; what was
    // cut off is missing and is appended as given.
    char resolved[PATH_MAX];
    while (realpath(head, resolved) == nullptr) {
        struct stat info;
        if ((errno != ENOENT && errno != ENOTDIR) || lstat(head, &info) == 0)
            return cx_posix_failure(errno == ENOENT || errno == ENOTDIR ? ELOOP : errno);
        char *cut = std::strrchr(head, '/');
        if (cut == nullptr || cut == head)
            return cx_posix_failure(ENOENT);
        *cut = '\0';
    }
    const char *rest = path + std::strlen(head);
    size_t length = std::strlen(resolved);
    if (length + std::strlen(rest) >= real_size)
        return cx_posix_failure(ENAMETOOLONG);
    std::memcpy(real, resolved, length);
    std::strcpy(real + length, rest);
    return CX_STATUS_SUCCESS;
}

}  // extern "C"
