/* Basic services: environment, locks, once-only setup, sleeping.
 *
 * The one place in the system that reads the process environment.
 * All functions are callable from any thread. */
#ifndef PLT_PLT1_H
#define PLT_PLT1_H

#include <pthread.h>
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

#define PLT1_API __attribute__((visibility("default")))

/* A lock. A lock defined with PLT1_LOCK_INITIALIZER (or zero-initialised as a
 * static) is usable at once, before any PLT1_InitializeLock: a process that
 * never runs its host's start-up can still take it. Not recursive: a thread
 * must not take a lock it already holds. */
typedef struct PLT1_LOCK {
    pthread_mutex_t mutex;
} PLT1_LOCK;

#define PLT1_LOCK_INITIALIZER { PTHREAD_MUTEX_INITIALIZER }

/* Returns the value of the environment variable `name`, or `dflt` when it is
 * not set. An empty value is a value. The pointer stays valid until the
 * variable is changed. */
PLT1_API const char *PLT1_GetEnv(const char *name, const char *dflt);

/* A whole number in `text`: decimal digits, or 0x and hexadecimal digits,
 * with nothing before or after. 1 and the number in `*value` when it lies in
 * min..max; else 0 and `*value` unchanged. */
PLT1_API int PLT1_ParseNumber(const char *text, uint32_t min, uint32_t max, uint32_t *value);
/* The environment variable `name` as PLT1_ParseNumber reads it; `dflt`
 * when it is unset or holds anything else. The one parser of every number
 * the platform's libraries read from the environment. */
PLT1_API uint32_t PLT1_GetEnvNumber(const char *name, uint32_t min, uint32_t max, uint32_t dflt);

/* Makes `lock` usable (again). REQUIRES: no thread holds or waits for it. */
PLT1_API void PLT1_InitializeLock(PLT1_LOCK *lock);
/* Ends `lock`; afterwards it is back in its initial, usable state.
 * REQUIRES: no thread holds or waits for it. */
PLT1_API void PLT1_DestroyLock(PLT1_LOCK *lock);
/* Takes `lock`, blocking the calling thread until it is free. */
PLT1_API void PLT1_GetLock(PLT1_LOCK *lock);
/* Releases `lock`. REQUIRES: the calling thread holds it. */
PLT1_API void PLT1_ReleaseLock(PLT1_LOCK *lock);

/* Runs routine(data) exactly once for `gate`, whichever threads arrive at the
 * same time; every caller returns only after the routine has finished. The
 * gate starts at 0 and is negative once the routine has run, so a caller may
 * skip the call when it reads a negative gate. Result: 0. */
PLT1_API int PLT1_InitializeOnce(volatile int32_t *gate, void (*routine)(void *), void *data,
                                 const char *file, int line);

/* Blocks the calling thread only, for `seconds` seconds. The length of a
 * second is 1000 ms unless "PLT1_SLEEP_UNIT_MS" says otherwise (tests use a
 * short unit to run long schedules quickly). Every call is counted. */
PLT1_API void PLT1_Sleep(uint32_t seconds);

/* Sleep accounting of this process: number of PLT1_Sleep calls and the sum of
 * their arguments in seconds, since start or the last reset. */
PLT1_API uint64_t PLT1_SleepCount(void);
PLT1_API uint64_t PLT1_SleepSeconds(void);
PLT1_API void PLT1_ResetSleepCount(void);

#ifdef __cplusplus
}
#endif
#endif
