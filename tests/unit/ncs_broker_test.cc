// The location broker, embedded in this process and reached over TCP.
#include "ncs/lb.h"
#include "process.h"
#include "test_support.h"

#include <gtest/gtest.h>

#include <arpa/inet.h>

#include <vector>

namespace {

const uuid__t kHub = {0x684152a8u, 0x52f9, 0, 0x02, {0xc6, 0xd2, 0x2d, 0xfd, 0, 0, 0}};
const uuid__t kOther = {0x01234567u, 0x89ab, 0, 0x02, {1, 2, 3, 4, 5, 6, 7}};

lb__entry_t entry_at(const uuid__t &interface, uint16_t port, sa_family_t family = AF_INET)
{
    lb__entry_t e{};
    e.obj_interface = interface;
    e.saddr_len = sizeof(sockaddr_in);
    e.saddr.in4 = {family, htons(port), {htonl(INADDR_LOOPBACK)}, {}};
    return e;
}

// The status of lb__register or lb__unregister of `e`.
uint32_t change(void (*operation)(const lb__entry_t *, uint32_t *), const lb__entry_t &e)
{
    uint32_t status = 1;
    operation(&e, &status);
    return status;
}

// One call of a walk against the broker at 127.0.0.1; the entries it gave.
std::vector<lb__entry_t> lookup(const uuid__t &interface, lb__lookup_handle_t &position, uint32_t &status,
                                uint32_t max_results = 1)
{
    const lb__entry_t location = entry_at(uuid__nil, 0);
    std::vector<lb__entry_t> results(max_results);
    uint32_t count = 99;
    lb__lookup_range(&uuid__nil, &uuid__nil, &interface, "", &location.saddr, location.saddr_len, &position,
                     max_results, &count, results.data(), &status);
    results.resize(std::min(count, max_results));
    return results;
}

// The ports of a walk from the start as a client that binds sees them:
// entries of families this process can't use are passed over (and counted).
// Checks that the walk ends with lb__s_not_registered and stays at its end.
std::vector<uint16_t> walk(const uuid__t &interface, uint32_t max_results = 1, int *passed_over = nullptr)
{
    std::vector<uint16_t> ports;
    lb__lookup_handle_t position = -1;
    uint32_t status = 1;
    for (int calls = 0; calls < 2000; ++calls) {
        std::vector<lb__entry_t> step = lookup(interface, position, status, max_results);
        for (const lb__entry_t &e : step) {
            if (socket__valid_family(e.saddr.sa.sa_family, &status))
                ports.push_back(ntohs(e.saddr.in4.sin_port));
            else if (passed_over != nullptr)
                ++*passed_over;
        }
        if (step.empty())
            break;
    }
    lb__lookup_handle_t end = position;
    EXPECT_TRUE(lookup(interface, position, status).empty());
    EXPECT_EQ(status, lb__s_not_registered);
    EXPECT_EQ(position, end);
    return ports;
}

// A broker inside this test process, at a free port that NCS_LB_PORT names.
class EmbeddedBroker : public ::testing::Test {
protected:
    void SetUp() override
    {
        uint32_t status = 1;
        lb__start_broker(nullptr, &status);
        ASSERT_EQ(status, rpc__s_ok);
    }
    void TearDown() override { lb__stop_broker(); }
    dpxtest::ScopedEnv port_{"NCS_LB_PORT", std::to_string(dpxtest::free_port())};
};

TEST_F(EmbeddedBroker, WalkGivesMatchingEntriesNewestFirstUntilTheyAreUnregistered)
{
    for (uint16_t port : {1001, 1002, 1003})
        ASSERT_EQ(change(lb__register, entry_at(kHub, port)), rpc__s_ok);
    ASSERT_EQ(change(lb__register, entry_at(kHub, 1004, AF_UNIX)), rpc__s_ok);
    ASSERT_EQ(change(lb__register, entry_at(kOther, 2001)), rpc__s_ok);
    for (uint32_t max_results : {1u, 2u, 40u}) {
        int passed_over = 0;
        EXPECT_EQ(walk(kHub, max_results, &passed_over), (std::vector<uint16_t>{1003, 1002, 1001})) << max_results;
        EXPECT_EQ(passed_over, 1);
    }
    EXPECT_EQ(walk(uuid__nil, 3), (std::vector<uint16_t>{2001, 1003, 1002, 1001}));
    // The same address again, from the process that holds it, renews the
    // entry in its place: a server renewing its registration doesn't push
    // newer ones back.
    ASSERT_EQ(change(lb__register, entry_at(kHub, 1001)), rpc__s_ok);
    EXPECT_EQ(walk(kHub), (std::vector<uint16_t>{1003, 1002, 1001}));
    for (uint16_t port : {1001, 1002, 1003})
        EXPECT_EQ(change(lb__unregister, entry_at(kHub, port)), rpc__s_ok);
    EXPECT_EQ(change(lb__unregister, entry_at(kHub, 1001)), lb__s_not_registered);
    EXPECT_TRUE(walk(kHub).empty());
}

TEST(Broker, LookupAndRegistrationAgainstAHostWithoutBrokerFailCleanly)
{
    dpxtest::ScopedEnv port("NCS_LB_PORT", std::to_string(dpxtest::free_port()));
    lb__lookup_handle_t position = -1;
    uint32_t status = 1;
    EXPECT_TRUE(lookup(kHub, position, status).empty());
    EXPECT_EQ(status, lb__s_broker_unreachable);
    EXPECT_EQ(position, -1);
    EXPECT_EQ(change(lb__register, entry_at(kHub, 1)), lb__s_broker_unreachable);
}

}  // namespace
