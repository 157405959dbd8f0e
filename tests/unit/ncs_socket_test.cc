// Host names, socket addresses and status texts of the runtime.
#include "dpx/dpx.h"
#include "ncs/lb.h"
#include "ncs/ncs.h"

#include <gtest/gtest.h>

#include <arpa/inet.h>

#include <cstring>
#include <filesystem>
#include <fstream>
#include <regex>
#include <sstream>
#include <string>

namespace {

struct Resolved {
    uint32_t status;
    socket__addr_t addr;
    uint32_t addr_len;
};

Resolved from_name(const std::string &name, uint32_t family = 0, uint32_t port = 4242, uint32_t room = 104)
{
    Resolved r{};
    std::memset(&r.addr, 0xAB, sizeof r.addr);
    r.addr_len = room;
    socket__from_name(family, name.data(), static_cast<uint32_t>(name.size()), port, &r.addr, &r.addr_len, &r.status);
    return r;
}

std::string host_of(const socket__addr_t &addr, uint32_t addr_len, uint32_t *port = nullptr)
{
    char name[100];
    uint32_t name_len = sizeof name;
    uint32_t found_port = 0;
    uint32_t status;
    socket__to_name(&addr, addr_len, name, &name_len, &found_port, &status);
    EXPECT_EQ(status, rpc__s_ok);
    EXPECT_EQ(name_len, std::strlen(name));
    if (port != nullptr)
        *port = found_port;
    return status == rpc__s_ok ? name : "";
}

TEST(SocketNames, NamesAndLiteralsResolveToAddressesWithThePortGiven)
{
    struct Case {
        const char *name;
        uint32_t family;
        sa_family_t expected_family;
        uint32_t expected_len;
        const char *expected_host;
    } cases[] = {
        {"127.0.0.1", 0, AF_INET, sizeof(sockaddr_in), "127.0.0.1"},
        {"127.0.0.1", AF_INET, AF_INET, sizeof(sockaddr_in), "127.0.0.1"},
        {"::1", 0, AF_INET6, sizeof(sockaddr_in6), "::1"},
        {"::1", AF_INET6, AF_INET6, sizeof(sockaddr_in6), "::1"},
        {"localhost", AF_INET, AF_INET, sizeof(sockaddr_in), "127.0.0.1"},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(std::string(c.name) + " family " + std::to_string(c.family));
        Resolved r = from_name(c.name, c.family);
        ASSERT_EQ(r.status, rpc__s_ok);
        EXPECT_EQ(r.addr.sa.sa_family, c.expected_family);
        EXPECT_EQ(r.addr_len, c.expected_len);
        uint32_t port = 0;
        EXPECT_EQ(host_of(r.addr, r.addr_len, &port), c.expected_host);
        EXPECT_EQ(port, 4242u);
    }
}

TEST(SocketNames, LocalhostWithAnyFamilyIsALoopbackAddress)
{
    Resolved r = from_name("localhost");
    ASSERT_EQ(r.status, rpc__s_ok);
    std::string host = host_of(r.addr, r.addr_len);
    EXPECT_TRUE(host.rfind("127.", 0) == 0 || host == "::1") << host;
}

TEST(SocketNames, OnlyTheFirstNameLenCharactersAreTheName)
{
    const char text[] = "127.0.0.1:and more";
    socket__addr_t addr;
    uint32_t addr_len = sizeof addr;
    uint32_t status;
    socket__from_name(0, text, 9, 80, &addr, &addr_len, &status);
    ASSERT_EQ(status, rpc__s_ok);
    EXPECT_EQ(host_of(addr, addr_len), "127.0.0.1");
}

TEST(SocketNames, NamesThatCannotBeResolvedFailAndLeaveTheAddressAlone)
{
    struct Case {
        std::string name;
        uint32_t family;
        uint32_t expected;
    } cases[] = {
        {"no such host", 0, rpc__s_unknown_host},
        {"host/name", 0, rpc__s_unknown_host},
        {"", 0, rpc__s_unknown_host},
        {std::string(300, 'a'), 0, rpc__s_unknown_host},
        {"127.0.0.1", AF_INET6, rpc__s_unknown_host},
        {"127.0.0.1", socket__family_inproc, socket__s_bad_family},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.name.substr(0, 30));
        Resolved r = from_name(c.name, c.family);
        EXPECT_EQ(r.status, c.expected);
        EXPECT_EQ(r.addr_len, 104u);
        EXPECT_EQ(r.addr.bytes[0], 0xAB);
    }
    EXPECT_EQ(from_name("127.0.0.1", 0, 65536).status, rpc__s_unknown_host);
}

TEST(SocketNames, AnAddressLargerThanTheRoomGivenIsRefused)
{
    Resolved r = from_name("::1", 0, 80, sizeof(sockaddr_in));
    EXPECT_EQ(r.status, socket__s_addr_too_small);
    EXPECT_EQ(r.addr_len, sizeof(sockaddr_in));
    EXPECT_EQ(r.addr.bytes[0], 0xAB);
}

TEST(SocketNames, ToNameNeverWritesPastTheRoomGiven)
{
    Resolved r = from_name("127.0.0.1");
    ASSERT_EQ(r.status, rpc__s_ok);
    char name[16];
    std::memset(name, 'x', sizeof name);
    uint32_t name_len = 9;  // "127.0.0.1" needs 10 with its NUL
    uint32_t port = 7;
    uint32_t status;
    socket__to_name(&r.addr, r.addr_len, name, &name_len, &port, &status);
    EXPECT_EQ(status, socket__s_name_too_long);
    EXPECT_EQ(name_len, 9u);
    EXPECT_EQ(port, 7u);
    EXPECT_EQ(std::string(name, sizeof name), std::string(sizeof name, 'x'));

    name_len = 10;
    socket__to_name(&r.addr, r.addr_len, name, &name_len, &port, &status);
    EXPECT_EQ(status, rpc__s_ok);
    EXPECT_EQ(name_len, 9u);
    EXPECT_STREQ(name, "127.0.0.1");
    EXPECT_EQ(name[10], 'x');

    socket__to_name(&r.addr, sizeof(sockaddr_in) - 1, name, &name_len, &port, &status);
    EXPECT_EQ(status, socket__s_bad_family);
}

TEST(SocketFamilies, OnlyIpv4Ipv6AndInProcessAreUsable)
{
    struct Case {
        uint32_t family;
        unsigned char valid;
    } cases[] = {{AF_INET, 1}, {AF_INET6, 1}, {socket__family_inproc, 1}, {AF_UNIX, 0}, {0, 0}, {0xFFFF, 0}};
    for (const Case &c : cases) {
        SCOPED_TRACE(c.family);
        uint32_t status = 12345;
        EXPECT_EQ(socket__valid_family(c.family, &status), c.valid);
        EXPECT_EQ(status, c.valid ? rpc__s_ok : socket__s_bad_family);
    }
}

TEST(SocketFamilies, InProcessAddressHoldsItsFamilyAndHasNoHostName)
{
    socket__addr_t addr;
    std::memset(&addr, 0xAB, sizeof addr);
    uint32_t addr_len = 0;
    socket__inproc_addr(&addr, &addr_len);
    EXPECT_EQ(addr.sa.sa_family, socket__family_inproc);
    EXPECT_EQ(addr_len, sizeof(sa_family_t));
    EXPECT_EQ(addr.bytes[103], 0);
    char name[64];
    uint32_t name_len = sizeof name;
    uint32_t port;
    uint32_t status;
    socket__to_name(&addr, addr_len, name, &name_len, &port, &status);
    EXPECT_EQ(status, socket__s_bad_family);
}

std::string text_of(uint32_t status)
{
    char buffer[256];
    EXPECT_EQ(error__c_text(status, buffer, sizeof buffer), buffer);
    return buffer;
}

TEST(StatusTexts, RuntimeAndLibraryStatusesHaveTheirTexts)
{
    EXPECT_EQ(text_of(rpc__s_connect_refused), "connection refused: no server listens at the address");
    EXPECT_EQ(text_of(lb__s_broker_unreachable), "location broker unreachable");
    EXPECT_EQ(text_of(DPX_E_CHECKSUM), "checksum mismatch");
    EXPECT_EQ(text_of(DPX_E_NO_HUB_HOST), "no hub host known");
}

TEST(StatusTexts, UnknownStatusHasTheEmptyText)
{
    EXPECT_EQ(text_of(0x12345678), "");
    EXPECT_EQ(text_of(0xF11E0002), "");
}

TEST(StatusTexts, TextIsCutToTheBufferAndNothingIsWrittenPastIt)
{
    char buffer[8];
    std::memset(buffer, 'x', sizeof buffer);
    error__c_text(DPX_E_CHECKSUM, buffer, 5);
    EXPECT_EQ(std::string(buffer, sizeof buffer), std::string("chec\0xxx", 8));

    std::memset(buffer, 'x', sizeof buffer);
    error__c_text(DPX_E_CHECKSUM, buffer, 1);
    EXPECT_EQ(buffer[0], '\0');
    EXPECT_EQ(buffer[1], 'x');

    std::memset(buffer, 'x', sizeof buffer);
    EXPECT_EQ(error__c_text(DPX_E_CHECKSUM, buffer, 0), buffer);
    EXPECT_EQ(buffer[0], 'x');
}

// Every status that the headers define, so that a new one without a text
// shows up here.
TEST(StatusTexts, EveryStatusDefinedInTheHeadersHasAText)
{
    std::filesystem::path root = std::filesystem::path(__FILE__).parent_path().parent_path().parent_path();
    const std::regex define(R"(#define\s+(\w+__s_\w+|DPX_E_\w+)\s+(0x[0-9A-Fa-f]+)u)");
    int seen = 0;
    for (const char *header : {"src/platform/ncs/ncs.h", "include/dpx/dpx.h"}) {
        std::ifstream in(root / header);
        ASSERT_TRUE(in) << header;
        std::stringstream text;
        text << in.rdbuf();
        std::string body = text.str();
        for (std::sregex_iterator m(body.begin(), body.end(), define), end; m != end; ++m) {
            ++seen;
            uint32_t status = static_cast<uint32_t>(std::stoul((*m)[2].str(), nullptr, 16));
            EXPECT_NE(text_of(status), "") << (*m)[1].str();
        }
    }
    EXPECT_GT(seen, 30);
}

}  // namespace
