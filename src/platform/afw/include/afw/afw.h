/* Agent framework: what the hosting agent knows about its place in the
 * system: the current hub's host name, its own node name, its product.
 *
 * Values come from the environment ("AFW_HUB_HOST", "AFW_ORIGIN_NODE",
 * "AFW_PRODUCT") unless a host program has set them with the AFW_Set...
 * functions, which take precedence. All functions are callable from any
 * thread. */
#ifndef AFW_AFW_H
#define AFW_AFW_H

#include <stddef.h>

#ifdef __cplusplus
extern "C" {
#endif

#define AFW_API __attribute__((visibility("default")))

/* Writes the current hub's host name into `buffer` (at most size - 1
 * characters and a NUL). Result 0 on success. With no hub known, or a name
 * that doesn't fit, the result is non-zero and the buffer holds the empty
 * string (when size > 0). */
AFW_API int AFW_GetCurrentHUBHost(char *buffer, size_t size);

/* The product name of this agent, or null when none is known. The text is
 * owned by the framework and stays valid for the life of the process. */
AFW_API const char *AFW_GetProductName(void);

/* The node name of this process: "AFW_ORIGIN_NODE", else the host name.
 * Never null; owned by the framework, valid for the life of the process. */
AFW_API const char *AFW_GetOriginnode(void);

/* Set by a host program; null goes back to the environment's value. */
AFW_API void AFW_SetCurrentHUBHost(const char *host);
AFW_API void AFW_SetProductName(const char *product);
AFW_API void AFW_SetOriginnode(const char *node);

#ifdef __cplusplus
}
#endif
#endif
