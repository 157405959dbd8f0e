// Host names, socket addresses and status texts of the runtime.
#include "ncs/ncs.h"

#include <gtest/gtest.h>

#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <regex>
#include <string>

namespace {

TEST(SocketNames, NamesResolveWithThePortGivenAndFailuresLeaveTheAddressAlone)
{
    const uint32_t ok = rpc__s_ok, unknown = rpc__s_unknown_host;
    // The first name_len characters of `name` are given; `host` is the
    // numeric form of the address on success.
    const struct { std::string name; uint32_t name_len, family, port, room, status; const char *host; } cases[] = {
        {"127.0.0.1", 9, 0, 4242, 104, ok, "127.0.0.1"},
        {"::1", 3, AF_INET6, 0, 104, ok, "::1"},
        {"localhost", 9, AF_INET, 65535, 104, ok, "127.0.0.1"},
        {"127.0.0.1:80", 9, 0, 4242, 104, ok, "127.0.0.1"},
        {std::string("::1\0:80", 7), 7, 0, 4242, 104, ok, "::1"},
        {"no such host", 12, 0, 4242, 104, unknown, nullptr},
        {"", 0, 0, 4242, 104, unknown, nullptr},
        {std::string(300, 'a'), 300, 0, 4242, 104, unknown, nullptr},
        {"127.0.0.1", 9, AF_INET6, 4242, 104, unknown, nullptr},
        {"127.0.0.1", 9, 0, 65536, 104, unknown, nullptr},
        {"127.0.0.1", 9, socket__family_inproc, 4242, 104, socket__s_bad_family, nullptr},
        {"::1", 3, 0, 4242, sizeof(sockaddr_in), socket__s_addr_too_small, nullptr},
    };
    for (const auto &c : cases) {
        socket__addr_t addr;
        std::memset(&addr, 0xAB, sizeof addr);
        uint32_t addr_len = c.room, status = 1, port = 0;
        socket__from_name(c.family, c.name.data(), c.name_len, c.port, &addr, &addr_len, &status);
        ASSERT_EQ(status, c.status) << c.name.substr(0, 20);
        if (c.host == nullptr) {
            EXPECT_TRUE(addr_len == c.room && addr.bytes[0] == 0xAB) << c.name.substr(0, 20);
            continue;
        }
        // Back to text: refused without a word written when the room misses
        // the NUL or the length misses a byte of the address.
        char name[64];
        std::memset(name, 'x', sizeof name);
        uint32_t name_len = static_cast<uint32_t>(std::strlen(c.host));
        socket__to_name(&addr, addr_len, name, &name_len, &port, &status);
        EXPECT_TRUE(status == socket__s_name_too_long && name[0] == 'x' && port == 0) << c.host;
        name_len += 1;
        socket__to_name(&addr, addr_len - 1, name, &name_len, &port, &status);
        EXPECT_TRUE(status == socket__s_bad_family && name[0] == 'x' && port == 0) << c.host;
        socket__to_name(&addr, addr_len, name, &name_len, &port, &status);
        EXPECT_STREQ(name, c.host);
        EXPECT_EQ(name[name_len + 1], 'x');
        EXPECT_EQ(port, c.port);
    }
}

// Every status the headers define has a text (so a new one without a text
// shows up here), cut to the buffer given.
TEST(StatusTexts, EveryStatusDefinedInTheHeadersHasATextCutToTheBuffer)
{
    std::filesystem::path root = std::filesystem::path(__FILE__).parent_path().parent_path().parent_path();
    const std::regex define(R"(#define\s+(\w+__s_\w+|DPX_E_\w+)\s+(0x[0-9A-Fa-f]+)u)");
    int seen = 0;
    for (const char *header : {"src/platform/ncs/core/include/ncs/ncs.h", "include/dpx/dpx.h"}) {
        std::ifstream in(root / header);
        const std::string body{std::istreambuf_iterator<char>(in), {}};
        for (std::sregex_iterator m(body.begin(), body.end(), define), end; m != end; ++m, ++seen) {
            char buffer[256];
            EXPECT_STRNE(error__c_text(std::stoul((*m)[2].str(), nullptr, 16), buffer, sizeof buffer), "")
                << (*m)[1].str();
        }
    }
    EXPECT_GT(seen, 30);
    const std::pair<size_t, std::string> cuts[] = {{5, {"chec\0xx", 7}}, {1, {"\0xxxxxx", 7}}, {0, "xxxxxxx"}};
    for (const auto &[size, expected] : cuts) {
        char buffer[7];
        std::memset(buffer, 'x', sizeof buffer);
        EXPECT_EQ(error__c_text(0xF11E0008u, buffer, size), buffer);
        EXPECT_EQ(std::string(buffer, sizeof buffer), expected) << size;
    }
}

}  // namespace
