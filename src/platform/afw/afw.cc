#include "afw/afw.h"

#include "plt/plt1.h"

#include <cstring>
#include <mutex>
#include <set>
#include <string>
#include <unistd.h>

namespace {

// Texts handed out are interned and never freed, so a pointer from the
// framework stays valid whatever a host program sets later.
struct State {
    std::mutex mutex;  // guards all below
    std::set<std::string> interned;
    bool hub_set = false, product_set = false, node_set = false;
    std::string hub, product, node;
};

State &state()
{
    static State *s = new State;
    return *s;
}

const char *intern(State &s, const std::string &text)
{
    return s.interned.insert(text).first->c_str();
}

void set_value(bool &is_set, std::string &value, const char *text)
{
    State &s = state();
    std::lock_guard<std::mutex> hold(s.mutex);
    is_set = text != nullptr;
    value = text != nullptr ? text : "";
}

}  // namespace

extern "C" {

int AFW_GetCurrentHUBHost(char *buffer, size_t size)
{
    if (buffer == nullptr || size == 0)
        return -1;
    buffer[0] = '\0';
    State &s = state();
    std::string host;
    {
        std::lock_guard<std::mutex> hold(s.mutex);
        if (s.hub_set) {
            host = s.hub;
        } else {
            const char *env = PLT1_GetEnv("AFW_HUB_HOST", nullptr);
            if (env == nullptr)
                return 1;
            host = env;
        }
    }
    if (host.size() >= size)
        return 2;
    std::memcpy(buffer, host.c_str(), host.size() + 1);
    return 0;
}

const char *AFW_GetProductName(void)
{
    State &s = state();
    std::lock_guard<std::mutex> hold(s.mutex);
    if (s.product_set)
        return intern(s, s.product);
    const char *env = PLT1_GetEnv("AFW_PRODUCT", nullptr);
    return env != nullptr ? intern(s, env) : nullptr;
}

const char *AFW_GetOriginnode(void)
{
    State &s = state();
    std::lock_guard<std::mutex> hold(s.mutex);
    if (s.node_set)
        return intern(s, s.node);
    const char *env = PLT1_GetEnv("AFW_ORIGIN_NODE", nullptr);
    if (env != nullptr)
        return intern(s, env);
    char host[256] = {0};
    if (gethostname(host, sizeof host - 1) != 0)
        host[0] = '\0';
    return intern(s, host);
}

void AFW_SetCurrentHUBHost(const char *host)
{
    State &s = state();
    set_value(s.hub_set, s.hub, host);
}

void AFW_SetProductName(const char *product)
{
    State &s = state();
    set_value(s.product_set, s.product, product);
}

void AFW_SetOriginnode(const char *node)
{
    State &s = state();
    set_value(s.node_set, s.node, node);
}

}  // extern "C"
