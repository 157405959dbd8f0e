/* Inner functions of the portable file services, shared by the modules of the
 * library and not exported.
 *
 * Like every cx_ operation they return a cx_status, throw nothing, write
 * their outputs only on success and can be called from any thread; a
 * cx_os_file_t is used by one thread at a time. */
#ifndef DPX_CXFILE_H
#define DPX_CXFILE_H

#include "dpx/dpx.h"

#include <stdbool.h>

#ifdef __cplusplus
extern "C" {
#endif

/* The success value: category '-', code 0. */
extern const cx_status CX_STATUS_SUCCESS;

/* A failure of category 'p' with `code`, a value of errno.h. */
cx_status cx_posix_failure(int32_t code);
/* A failure of category 'p' with the calling thread's errno, which the caller
 * reads straight after the failed platform call. */
cx_status cx_errno_failure(void);
/* True when `status` is a success: only its category decides. */
bool cx_succeeded(cx_status status);

/* Makes every missing directory above the file `path` with mode 0777,
 * whatever the umask. `path` has at most 254 characters (ENAMETOOLONG
 * otherwise). A bare name or a name right under the root has no directory to
 * make: it succeeds with nothing made. */
cx_status cx_mkdirs_for_file(const char *path);

/* The real location of `path` into `real` of `real_size` bytes: its longest
 * leading part that exists, with every symbolic link, "." and ".." resolved,
 * then the missing levels as `path` gives them. Fails with ELOOP when a
 * level exists but can't be resolved (a link to nothing, a loop of links),
 * ENAMETOOLONG when the result doesn't fit, else with the platform's errno. */
cx_status cx_real_path(const char *path, char *real, size_t real_size);

/* The bodies of the exported operations of the same name without "posix":
 * they call the platform and make no directories. */
cx_status cx_open_posix_file(const char *path, cx_os_file_t *file, int32_t mode);
cx_status cx_temp_posix_file(const char *directory, char **name, cx_os_file_t *file);
cx_status cx_delete_posix_file(const char *path);
cx_status cx_move_posix_file(const char *source, const char *destination);
cx_status cx_copy_posix_file(const char *source, const char *destination);

#ifdef __cplusplus
}
#endif

#endif
