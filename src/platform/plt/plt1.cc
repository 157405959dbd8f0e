#include "plt/plt1.h"

#include <atomic>
#include <charconv>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <thread>

namespace {

std::atomic<uint64_t> g_sleep_count{0};
std::atomic<uint64_t> g_sleep_seconds{0};
std::recursive_mutex g_once_mutex;  // a routine may itself set up another gate

int64_t sleep_unit_ms()
{
    return PLT1_GetEnvNumber("PLT1_SLEEP_UNIT_MS", 0, UINT32_MAX, 1000);
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

int PLT1_ParseNumber(const char *text, uint32_t min, uint32_t max, uint32_t *value)
{
    if (text == nullptr || value == nullptr)
        return 0;
    const bool hex = text[0] == '0' && (text[1] == 'x' || text[1] == 'X');
    const char *begin = hex ? text + 2 : text;
    const char *end = begin + std::strlen(begin);
    uint32_t parsed = 0;
    // from_chars takes no blank, sign or prefix: the text is digits only.
    auto [stop, error] = std::from_chars(begin, end, parsed, hex ? 16 : 10);
    if (error != std::errc() || stop != end || stop == begin || parsed < min || parsed > max)
        return 0;
    *value = parsed;
    return 1;
}

uint32_t PLT1_GetEnvNumber(const char *name, uint32_t min, uint32_t max, uint32_t dflt)
{
    uint32_t value = dflt;
    PLT1_ParseNumber(PLT1_GetEnv(name, nullptr), min, max, &value);
    return value;
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
