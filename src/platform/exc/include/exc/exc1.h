/* Exception frames.
 *
 * A raise hands a status to the innermost armed frame of the calling thread
 * and leaves every callee between. Frames form a chain per thread; a frame of
 * one thread never sees a raise of another.
 *
 * Built on C++ exceptions: EXC1__Raise throws exc::Fault, and a frame is a
 * try block (EXC1_Guard). A raise must therefore only pass through code
 * compiled as C++; every exported C entry point of the system stops it with a
 * frame of its own. No setjmp/longjmp is involved. */
#ifndef EXC_EXC1_H
#define EXC_EXC1_H

#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

#define EXC1_API __attribute__((visibility("default")))

/* Kind of an armed frame, and the value EXC1_Guard returns when its body ran
 * to its end without a raise. */
#define EXC1_FRAME_SET 0x03040003u

/* What a raise of EXC1_FRAME_SET carries instead: a raise must never read as
 * a body that ran to its end. */
#define EXC1_S_FRAME_SET_RAISED 0x030400FFu

typedef struct EXC1_CONTEXT EXC1_CONTEXT;

typedef struct EXC1_FRAME {
    struct EXC1_FRAME *link;     /* frame below this one, or null */
    EXC1_CONTEXT *context;       /* the owning thread's context */
    uint32_t kind;               /* EXC1_FRAME_SET while armed */
    uint32_t inherited[2];       /* copied from the frame below, 0 without one */
} EXC1_FRAME;

/* Per-thread exception context. */
struct EXC1_CONTEXT {
    EXC1_FRAME *top;             /* the thread's innermost frame, or null */
    uint32_t status;             /* the status raised last on this thread */
    uint32_t handling;           /* 1 between a raise and EXC1_Allow */
};

/* The calling thread's context. Never null. */
EXC1_API EXC1_CONTEXT *EXC1_Thread(void);

/* Raises `status` on the thread of `context` (the calling thread's);
 * EXC1_FRAME_SET is raised as EXC1_S_FRAME_SET_RAISED. Does not return. REQUIRES: a frame is armed on the calling thread, or the caller
 * is prepared to catch exc::Fault itself. */
EXC1_API __attribute__((noreturn)) void EXC1__Raise(EXC1_CONTEXT *context, uint32_t status);

/* Takes `frame` off the chain of `context` when it isn't the innermost one
 * (frames above it are dropped with it). Result 0, or -1 if `frame` isn't on
 * the chain. `file` and `line` name the caller for diagnostics. */
EXC1_API int EXC1__DropFrame(EXC1_CONTEXT *context, EXC1_FRAME *frame, const char *file, int line);

/* Ends the handling of a fault that goes no further. */
EXC1_API void EXC1_Allow(void);

#ifdef __cplusplus
}

namespace exc {

/* What EXC1__Raise throws. */
struct Fault {
    uint32_t status;
};

/* Arms `frame` on the calling thread and runs `body` inside it.
 * Returns EXC1_FRAME_SET when the body ran to its end (the frame is off the
 * chain again), or the status of a raise that reached the frame (the frame
 * and all above it are off the chain by then). Other C++ exceptions pass
 * through with the frame taken off. */
template <class Body>
uint32_t guard(EXC1_FRAME *frame, const char *file, int line, Body &&body)
{
    EXC1_CONTEXT *context = EXC1_Thread();
    EXC1_FRAME *below = context->top;
    frame->link = below;
    frame->context = context;
    frame->kind = EXC1_FRAME_SET;
    frame->inherited[0] = below != nullptr ? below->inherited[0] : 0;
    frame->inherited[1] = below != nullptr ? below->inherited[1] : 0;
    context->top = frame;
    try {
        body();
    } catch (const Fault &fault) {
        context->top = below;
        frame->kind = 0;
        return fault.status;
    } catch (...) {
        context->top = below;
        frame->kind = 0;
        throw;
    }
    if (context->top == frame)
        context->top = below;
    else
        EXC1__DropFrame(context, frame, file, line);
    frame->kind = 0;
    return EXC1_FRAME_SET;
}

}  // namespace exc
#endif /* __cplusplus */

#endif
