/* Tracing.
 *
 * Each traced function owns one static descriptor, TRC1_DESC. The flags that
 * decide what it writes are cached in the descriptor together with a stamp:
 * while the stamp equals the unit's sync word the cached flags hold, otherwise
 * TRC1_Sync works them out afresh. Changing the configuration moves the sync
 * word on, so every descriptor takes the new flags at its next use.
 *
 * Configuration: "TRC1_FLAGS" is the flag mask in C integer syntax (0xC1,
 * 193, 0301); unset means nothing is traced. "TRC1_FILE" names a file that
 * lines are appended to; unset means standard error. Both are read at the
 * first use and again by TRC1_Configure.
 *
 * Line format:
 *   2026-11-22T23:59:01.123456Z pid 123 tid 456 dpxbuff dpx_alloc_xfer_buff:42 message
 * Entry and exit events write "ENTER", "EXIT" or "EXIT result=<n>" as the
 * message. A trailing newline of a message is not doubled.
 *
 * All functions are callable from any thread. Tracing never changes a result:
 * a failed write is dropped. */
#ifndef TRC_TRC1_H
#define TRC_TRC1_H

#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

#define TRC1_API __attribute__((visibility("default")))

#define TRC1_FLOW  0x01u
#define TRC1_ENTRY 0x40u
#define TRC1_ERROR 0x80u

#define TRC1_EVENT_ENTRY  0
#define TRC1_EVENT_RESULT 1
#define TRC1_EVENT_EXIT   2

#define TRC1_DESC_MAGIC 0x200u

/* Identifies a source unit. */
typedef struct TRC1_UNIT {
    const char *name;
} TRC1_UNIT;

/* The static descriptor of one traced function. */
typedef struct TRC1_DESC {
    const TRC1_UNIT *unit;
    const char *function;
    uint32_t function_length;
    uint32_t line;              /* line where the function starts */
    volatile uint32_t *sync;    /* the unit's sync word */
    uint32_t magic;             /* TRC1_DESC_MAGIC */
    uint32_t flags;             /* cached flags, valid while stamp == *sync */
    uint32_t stamp;
    uint32_t spare[2];
} TRC1_DESC;

/* The sync word shared by every unit of the process. Starts at 1, so a fresh
 * descriptor (stamp 0) always syncs first. */
TRC1_API extern volatile uint32_t TRC1_SyncWord;

/* Works out the flags for `desc`, stores them with the current stamp in it
 * and returns them. */
TRC1_API uint32_t TRC1_Sync(TRC1_DESC *desc);

/* Writes an event: code TRC1_EVENT_ENTRY or TRC1_EVENT_EXIT; TRC1_EVENT_RESULT
 * takes one more argument, a long, the function's result. */
TRC1_API void TRC1_Event(TRC1_DESC *desc, int line, int code, ...);

/* Writes one message line, printf style. */
TRC1_API void TRC1_Printf(TRC1_DESC *desc, int line, const char *format, ...)
    __attribute__((format(printf, 3, 4)));

/* Sets the flag mask and the output file (null: standard error) at run time
 * and moves the sync word on. */
TRC1_API void TRC1_Configure(uint32_t flags, const char *file);

/* Re-reads "TRC1_FLAGS" and "TRC1_FILE" and moves the sync word on. */
TRC1_API void TRC1_Reload(void);

/* The flag mask in force. */
TRC1_API uint32_t TRC1_Flags(void);

#ifdef __cplusplus
}

namespace trc {

/* The flags of a descriptor, cached or synced, as every traced function takes
 * them at its start. */
inline uint32_t flags_of(TRC1_DESC *desc)
{
    // Descriptors are shared by all threads that run the function: the stamp
    // is published after the flags, so a matching stamp means valid flags.
    uint32_t sync = __atomic_load_n(desc->sync, __ATOMIC_ACQUIRE);
    if (__atomic_load_n(&desc->stamp, __ATOMIC_ACQUIRE) == sync)
        return __atomic_load_n(&desc->flags, __ATOMIC_RELAXED);
    return TRC1_Sync(desc);
}

/* Entry and exit events of one run of a traced function. */
class Scope {
public:
    Scope(TRC1_DESC *desc, int line) : desc_(desc), line_(line), flags_(flags_of(desc))
    {
        if (flags_ & TRC1_ENTRY) {
            entered_ = true;
            TRC1_Event(desc_, line_, TRC1_EVENT_ENTRY);
        }
    }
    ~Scope()
    {
        if (entered_) {
            if (has_result_)
                TRC1_Event(desc_, line_, TRC1_EVENT_RESULT, result_);
            else
                TRC1_Event(desc_, line_, TRC1_EVENT_EXIT);
        }
    }
    Scope(const Scope &) = delete;
    Scope &operator=(const Scope &) = delete;

    bool on(uint32_t flag) const { return (flags_ & flag) != 0; }
    TRC1_DESC *desc() const { return desc_; }
    /* Makes the exit event carry `result`. */
    void set_result(long result)
    {
        has_result_ = true;
        result_ = result;
    }

private:
    TRC1_DESC *desc_;
    int line_;
    uint32_t flags_;
    bool entered_ = false;
    bool has_result_ = false;
    long result_ = 0;
};

}  // namespace trc

/* Names the source unit of a file; once per file, at file scope. */
#define TRC1_DEFINE_UNIT(name_text) static const TRC1_UNIT trc1_unit_ = {name_text}

/* First line of a traced function: its descriptor and its entry/exit events. */
#define TRC1_FUNCTION()                                                                        \
    static TRC1_DESC trc1_desc_ = {&trc1_unit_, __func__, sizeof(__func__) - 1, __LINE__,     \
                                   &TRC1_SyncWord, TRC1_DESC_MAGIC, 0, 0, {0, 0}};             \
    trc::Scope trc1_scope_(&trc1_desc_, __LINE__)

/* Messages at the flow and the error level. The format is only looked at when
 * the flag is set. */
#define TRC1_FLOW_MSG(...)                                                   \
    do {                                                                     \
        if (trc1_scope_.on(TRC1_FLOW))                                       \
            TRC1_Printf(trc1_scope_.desc(), __LINE__, __VA_ARGS__);          \
    } while (0)
#define TRC1_ERROR_MSG(...)                                                  \
    do {                                                                     \
        if (trc1_scope_.on(TRC1_ERROR))                                      \
            TRC1_Printf(trc1_scope_.desc(), __LINE__, __VA_ARGS__);          \
    } while (0)
#endif /* __cplusplus */

#endif
