#include "exc/exc1.h"

namespace {
thread_local EXC1_CONTEXT t_context = {nullptr, 0, 0};
}

extern "C" {

EXC1_CONTEXT *EXC1_Thread(void)
{
    return &t_context;
}

void EXC1__Raise(EXC1_CONTEXT *context, uint32_t status)
{
    EXC1_CONTEXT *own = context != nullptr ? context : &t_context;
    if (status == EXC1_FRAME_SET)
        status = EXC1_S_FRAME_SET_RAISED;
    own->status = status;
    own->handling = 1;
    throw exc::Fault{status};
}

int EXC1__DropFrame(EXC1_CONTEXT *context, EXC1_FRAME *frame, const char *, int)
{
    if (context == nullptr || frame == nullptr)
        return -1;
    for (EXC1_FRAME *f = context->top; f != nullptr; f = f->link) {
        if (f == frame) {
            context->top = frame->link;
            return 0;
        }
    }
    return -1;
}

void EXC1_Allow(void)
{
    t_context.handling = 0;
}

}  // extern "C"
