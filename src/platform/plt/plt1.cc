#include "plt/plt1.h"

#include <atomic>
#include <chrono>
#include <cstdlib>
#include <mutex>
#include <thread>

namespace {

std::atomic<uint64_t> g_sleep_count{0};
std::atomic<uint64_t> g_sleep_seconds{0};
std::recursive_mutex g_once_mutex;  // a routine may itself set up another gate

long sleep_unit_ms()
{
    const char *v = std::getenv("PLT1_SLEEP_UNIT_MS");
    if (v == nullptr || *v == '\0')
        return 1000;
    char *end = nullptr;
    long ms = std::strtol(v, &end, 10);
    return (end != v && ms >= 0) ? ms : 1000;
}

}  // namespace

extern "C" {

const char *PLT1_GetEnv(const char *name, const char *dflt)
{
    if (name == nullptr)
        return dflt;
    const char *v = std::getenv(name);
    return v != nullptr ? v : dflt;
}

void PLT1_InitializeLock(PLT1_LOCK *lock)
{
    pthread_mutex_init(&lock->mutex, nullptr);
}

void PLT1_DestroyLock(PLT1_LOCK *lock)
{
    pthread_mutex_destroy(&lock->mutex);
    *lock = PLT1_LOCK PLT1_LOCK_INITIALIZER;
}

void PLT1_GetLock(PLT1_LOCK *lock)
{
    pthread_mutex_lock(&lock->mutex);
}

void PLT1_ReleaseLock(PLT1_LOCK *lock)
{
    pthread_mutex_unlock(&lock->mutex);
}

int PLT1_InitializeOnce(volatile int32_t *gate, void (*routine)(void *), void *data, const char *, int)
{
    auto *word = reinterpret_cast<std::atomic<int32_t> *>(const_cast<int32_t *>(gate));
    if (word->load(std::memory_order_acquire) < 0)
        return 0;
    std::lock_guard<std::recursive_mutex> hold(g_once_mutex);
    if (word->load(std::memory_order_acquire) >= 0) {
        routine(data);
        word->store(-1, std::memory_order_release);
    }
    return 0;
}

void PLT1_Sleep(uint32_t seconds)
{
    g_sleep_count.fetch_add(1);
    g_sleep_seconds.fetch_add(seconds);
    std::this_thread::sleep_for(std::chrono::milliseconds(static_cast<int64_t>(seconds) * sleep_unit_ms()));
}

uint64_t PLT1_SleepCount(void) { return g_sleep_count.load(); }
uint64_t PLT1_SleepSeconds(void) { return g_sleep_seconds.load(); }
void PLT1_ResetSleepCount(void)
{
    g_sleep_count.store(0);
    g_sleep_seconds.store(0);
}

}  // extern "C"
