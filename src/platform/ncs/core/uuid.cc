// UUIDs of the runtime and their text form.
#include "ncs/ncs.h"

#include <cstdio>
#include <cstring>

extern "C" {

const uuid__t uuid__nil = {0, 0, 0, 0, {0, 0, 0, 0, 0, 0, 0}};

void uuid__decode(const char *text, uuid__t *uuid, uint32_t *status)
{
    if (status != nullptr)
        *status = uuid__s_bad_text;
    if (text == nullptr || uuid == nullptr)
        return;
    // 12 hex digits, then 8 dot-separated pairs: 12 + 8 * 3 = 36 characters.
    if (std::strlen(text) != 36)
        return;
    unsigned bytes[14];
    for (int i = 0; i < 6; ++i) {
        if (std::sscanf(text + 2 * i, "%2x", &bytes[i]) != 1)
            return;
    }
    for (int i = 0; i < 8; ++i) {
        const char *p = text + 12 + 3 * i;
        if (p[0] != '.' || std::sscanf(p + 1, "%2x", &bytes[6 + i]) != 1)
            return;
    }
    for (const char *p = text; *p != '\0'; ++p) {
        bool hex = (*p >= '0' && *p <= '9') || (*p >= 'a' && *p <= 'f') || (*p >= 'A' && *p <= 'F');
        if (!hex && *p != '.')
            return;
    }
    uuid__t u;
    u.time_high = (uint32_t(bytes[0]) << 24) | (uint32_t(bytes[1]) << 16) | (uint32_t(bytes[2]) << 8) | bytes[3];
    u.time_low = static_cast<uint16_t>((bytes[4] << 8) | bytes[5]);
    u.reserved = 0;
    u.family = static_cast<uint8_t>(bytes[6]);
    for (int i = 0; i < 7; ++i)
        u.host[i] = static_cast<uint8_t>(bytes[7 + i]);
    *uuid = u;
    if (status != nullptr)
        *status = rpc__s_ok;
}

void uuid__encode(const uuid__t *uuid, char text[37])
{
    std::snprintf(text, 37, "%08x%04x.%02x.%02x.%02x.%02x.%02x.%02x.%02x.%02x", uuid->time_high, uuid->time_low,
                  uuid->family, uuid->host[0], uuid->host[1], uuid->host[2], uuid->host[3], uuid->host[4],
                  uuid->host[5], uuid->host[6]);
}

int uuid__equal(const uuid__t *a, const uuid__t *b)
{
    return a->time_high == b->time_high && a->time_low == b->time_low && a->reserved == b->reserved &&
           a->family == b->family && std::memcmp(a->host, b->host, sizeof a->host) == 0;
}

}  // extern "C"
