// Settings of the runtime from the environment.
#include "ncs/runtime.h"

#include "plt/plt1.h"


namespace ncs {

uint32_t setting(const char *name, uint32_t dflt)
{
    return PLT1_GetEnvNumber(name, 1, UINT32_MAX, dflt);
}

}  // namespace ncs
