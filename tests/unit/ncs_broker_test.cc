// The location broker: embedded in this process, and as the program dpx-lbd
// serving other processes.
#include "ncs/lb.h"
#include "ncs/lb_format.h"
#include "ncs/ncs.h"
#include "process.h"
#include "test_support.h"

#include <gtest/gtest.h>

#include <arpa/inet.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstring>
#include <optional>
#include <string>
#include <thread>
#include <vector>

namespace {

using dpxtest::ScopedEnv;

const uuid__t kHub = [] {
    uuid__t u;
    uint32_t status;
    uuid__decode("684152a852f9.02.c6.d2.2d.fd.00.00.00", &u, &status);
    return u;
}();
const uuid__t kOther = [] {
    uuid__t u;
    uint32_t status;
    uuid__decode("0123456789ab.02.01.02.03.04.05.06.07", &u, &status);
    return u;
}();

lb__entry_t entry_at(const uuid__t &interface, uint16_t port, sa_family_t family = AF_INET)
{
    lb__entry_t e{};
    e.obj_interface = interface;
    std::strcpy(e.annotation, "test server");
    e.saddr_len = sizeof(sockaddr_in);
    e.saddr.in4.sin_family = family;
    e.saddr.in4.sin_port = htons(port);
    e.saddr.in4.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    return e;
}

uint16_t port_of(const lb__entry_t &e)
{
    return ntohs(e.saddr.in4.sin_port);
}

uint32_t register_entry(const lb__entry_t &e)
{
    uint32_t status = 12345;
    lb__register(&e, &status);
    return status;
}

uint32_t unregister_entry(const lb__entry_t &e)
{
    uint32_t status = 12345;
    lb__unregister(&e, &status);
    return status;
}

socket__addr_t host_address(const char *host, uint32_t &len)
{
    socket__addr_t addr;
    len = sizeof addr;
    uint32_t status;
    socket__from_name(0, host, static_cast<uint32_t>(std::strlen(host)), 0, &addr, &len, &status);
    EXPECT_EQ(status, rpc__s_ok);
    return addr;
}

// One call of a walk against the broker of `host`.
struct Step {
    uint32_t status;
    uint32_t count;
    std::vector<lb__entry_t> entries;
};

Step lookup(const uuid__t &interface, lb__lookup_handle_t &position, uint32_t max_results = 1,
            const char *host = "127.0.0.1")
{
    uint32_t len;
    socket__addr_t location = host_address(host, len);
    std::vector<lb__entry_t> results(max_results);
    Step step{12345, 99, {}};
    lb__lookup_range(&uuid__nil, &uuid__nil, &interface, "", &location, len, &position, max_results, &step.count,
                     results.data(), &step.status);
    step.entries.assign(results.begin(), results.begin() + std::min(step.count, max_results));
    return step;
}

// The ports of all entries of a walk from the start, and how it ended.
struct Walk {
    std::vector<uint16_t> ports;
    uint32_t end_status = 0;
    lb__lookup_handle_t end_position = -1;
};

Walk walk(const uuid__t &interface, uint32_t max_results = 1)
{
    Walk w;
    for (int calls = 0; calls < 2000; ++calls) {
        Step step = lookup(interface, w.end_position, max_results);
        if (step.count == 0) {
            w.end_status = step.status;
            return w;
        }
        EXPECT_EQ(step.status, rpc__s_ok);
        for (const lb__entry_t &e : step.entries)
            w.ports.push_back(port_of(e));
    }
    ADD_FAILURE() << "the walk doesn't end";
    return w;
}

// A broker inside this test process, at a free port that NCS_LB_PORT names.
class EmbeddedBroker : public ::testing::Test {
protected:
    void SetUp() override
    {
        uint32_t status;
        {
            ScopedEnv any_port("NCS_LB_PORT", "0");
            lb__start_broker(nullptr, &status);
        }
        ASSERT_EQ(status, rpc__s_ok);
        socket__addr_t addr;
        uint32_t len = sizeof addr;
        lb__inq_broker(&addr, &len, &status);
        ASSERT_EQ(status, rpc__s_ok);
        port_.emplace("NCS_LB_PORT", std::to_string(ntohs(addr.in4.sin_port)));
    }
    void TearDown() override { lb__stop_broker(); }

    std::optional<ScopedEnv> port_;
};

TEST_F(EmbeddedBroker, RegisteredEntryIsFoundUntilItIsUnregistered)
{
    lb__entry_t hub = entry_at(kHub, 5001);
    ASSERT_EQ(register_entry(hub), rpc__s_ok);

    lb__lookup_handle_t position = -1;
    Step step = lookup(kHub, position);
    ASSERT_EQ(step.status, rpc__s_ok);
    ASSERT_EQ(step.count, 1u);
    EXPECT_EQ(port_of(step.entries[0]), 5001);
    EXPECT_EQ(step.entries[0].saddr_len, sizeof(sockaddr_in));
    EXPECT_STREQ(step.entries[0].annotation, "test server");

    EXPECT_EQ(unregister_entry(hub), rpc__s_ok);
    Walk w = walk(kHub);
    EXPECT_TRUE(w.ports.empty());
    EXPECT_EQ(w.end_status, lb__s_not_registered);
    EXPECT_EQ(unregister_entry(hub), lb__s_not_registered);
}

TEST_F(EmbeddedBroker, WalkReturnsMatchingEntriesNewestFirstAndStaysAtItsEnd)
{
    for (uint16_t port : {1001, 1002, 1003})
        ASSERT_EQ(register_entry(entry_at(kHub, port)), rpc__s_ok);
    ASSERT_EQ(register_entry(entry_at(kOther, 2001)), rpc__s_ok);

    for (uint32_t max_results : {1u, 2u, 40u}) {
        SCOPED_TRACE(max_results);
        Walk w = walk(kHub, max_results);
        EXPECT_EQ(w.ports, (std::vector<uint16_t>{1003, 1002, 1001}));
        EXPECT_EQ(w.end_status, lb__s_not_registered);

        lb__lookup_handle_t position = w.end_position;
        Step again = lookup(kHub, position);
        EXPECT_EQ(again.status, lb__s_not_registered);
        EXPECT_EQ(again.count, 0u);
        EXPECT_EQ(position, w.end_position);
    }
    EXPECT_EQ(walk(uuid__nil, 3).ports, (std::vector<uint16_t>{2001, 1003, 1002, 1001}));
}

TEST_F(EmbeddedBroker, ServerRegisteredAgainOnAnotherPortIsFoundFirst)
{
    ASSERT_EQ(register_entry(entry_at(kHub, 3001)), rpc__s_ok);
    ASSERT_EQ(register_entry(entry_at(kHub, 3002)), rpc__s_ok);
    EXPECT_EQ(walk(kHub).ports, (std::vector<uint16_t>{3002, 3001}));

    // The same address again replaces its entry, which becomes the newest.
    ASSERT_EQ(register_entry(entry_at(kHub, 3001)), rpc__s_ok);
    EXPECT_EQ(walk(kHub).ports, (std::vector<uint16_t>{3001, 3002}));
}

// The walk of a client that binds: entries of families it can't use are
// passed over, and the first usable one is taken.
TEST_F(EmbeddedBroker, EntryOfUnusableFamilyIsSkippedAndTheNextOneIsFound)
{
    ASSERT_EQ(register_entry(entry_at(kHub, 4001)), rpc__s_ok);
    ASSERT_EQ(register_entry(entry_at(kHub, 4002, AF_UNIX)), rpc__s_ok);

    lb__lookup_handle_t position = -1;
    std::vector<uint32_t> refused;
    std::optional<lb__entry_t> usable;
    for (int calls = 0; calls < 10 && !usable; ++calls) {
        Step step = lookup(kHub, position);
        ASSERT_EQ(step.count, 1u);
        uint32_t status;
        if (socket__valid_family(step.entries[0].saddr.sa.sa_family, &status))
            usable = step.entries[0];
        else
            refused.push_back(status);
    }
    EXPECT_EQ(refused, std::vector<uint32_t>{socket__s_bad_family});
    ASSERT_TRUE(usable);
    EXPECT_EQ(port_of(*usable), 4001);
}

TEST_F(EmbeddedBroker, EntriesBeyondTheLimitAreRefused)
{
    for (uint32_t i = 0; i < 1024; ++i)
        ASSERT_EQ(register_entry(entry_at(kOther, static_cast<uint16_t>(10000 + i))), rpc__s_ok);
    EXPECT_EQ(register_entry(entry_at(kOther, 9999)), lb__s_database_full);
    EXPECT_EQ(register_entry(entry_at(kOther, 10000)), rpc__s_ok);

    lb__entry_t too_long = entry_at(kHub, 1);
    too_long.saddr_len = 105;
    EXPECT_EQ(register_entry(too_long), lb__s_bad_argument);
}

TEST_F(EmbeddedBroker, MalformedRequestClosesItsConnectionAndTheBrokerServesOn)
{
    ASSERT_EQ(register_entry(entry_at(kHub, 6001)), rpc__s_ok);
    for (uint32_t body_len : {0xFFFFFFFFu, 0u, uint32_t(ncs::lb::kEntrySize + 1)}) {
        SCOPED_TRACE(body_len);
        int fd = socket(AF_INET, SOCK_STREAM, 0);
        sockaddr_in a{};
        a.sin_family = AF_INET;
        a.sin_port = htons(lb__broker_port());
        a.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        ASSERT_EQ(connect(fd, reinterpret_cast<sockaddr *>(&a), sizeof a), 0);
        uint8_t header[ncs::lb::kHeaderSize];
        ncs::lb::Writer writer(header);
        ncs::lb::put_header(writer, {ncs::lb::kMagic, ncs::lb::kVersion, ncs::lb::Kind::kRegister, body_len});
        ASSERT_EQ(send(fd, header, sizeof header, 0), static_cast<ssize_t>(sizeof header));
        pollfd p{fd, POLLIN, 0};
        ASSERT_EQ(poll(&p, 1, 10000), 1);
        char byte;
        EXPECT_EQ(recv(fd, &byte, 1, 0), 0) << "the broker answered instead of closing";
        close(fd);
    }
    EXPECT_EQ(walk(kHub).ports, std::vector<uint16_t>{6001});
}

TEST(Broker, LookupAndRegistrationAgainstAHostWithoutBrokerFailCleanly)
{
    ScopedEnv port("NCS_LB_PORT", std::to_string(dpxtest::free_port()));
    lb__lookup_handle_t position = -1;
    Step step = lookup(kHub, position);
    EXPECT_EQ(step.status, lb__s_broker_unreachable);
    EXPECT_EQ(step.count, 0u);
    EXPECT_EQ(position, -1);
    EXPECT_EQ(register_entry(entry_at(kHub, 1)), lb__s_broker_unreachable);
}

// dpx-lbd at a free port, which it names on its standard output; its log
// goes to a file in `dir`.
dpxtest::Process broker_program(const dpxtest::TempDir &dir, std::vector<std::string> args = {})
{
    args.insert(args.begin(), dpxtest::bin_dir() + "/dpx-lbd");
    return dpxtest::Process(args, {{"NCS_LB_PORT", "0"}}, dir / "dpx-lbd.log");
}

// The port of a line "listening on HOST:PORT".
std::string port_in(const std::string &line)
{
    return line.substr(line.rfind(':') + 1);
}

int exit_code(int wstatus)
{
    return WIFEXITED(wstatus) ? WEXITSTATUS(wstatus) : -1;
}

TEST(BrokerProgram, RemovesTheEntriesOfAProcessThatIsKilled)
{
    dpxtest::TempDir dir;
    dpxtest::Process broker = broker_program(dir);
    std::optional<std::string> line = broker.wait_line("listening on 127.0.0.1:");
    ASSERT_TRUE(line);
    ScopedEnv port("NCS_LB_PORT", port_in(*line));

    lb__entry_t mine = entry_at(kHub, 7001);
    ASSERT_EQ(register_entry(mine), rpc__s_ok);

    int ready[2];
    ASSERT_EQ(pipe(ready), 0);
    pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        char outcome = register_entry(entry_at(kHub, 7002)) == rpc__s_ok ? 'r' : 'f';
        if (write(ready[1], &outcome, 1) != 1)
            _exit(1);
        for (;;)
            pause();
    }
    close(ready[1]);
    char outcome = 0;
    EXPECT_EQ(read(ready[0], &outcome, 1), 1);
    close(ready[0]);
    EXPECT_EQ(outcome, 'r');
    EXPECT_EQ(walk(kHub).ports, (std::vector<uint16_t>{7002, 7001}));

    kill(child, SIGKILL);
    waitpid(child, nullptr, 0);
    // The broker learns of the closed connection on its own thread.
    Walk w = walk(kHub);
    for (auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
         w.ports.size() > 1 && std::chrono::steady_clock::now() < deadline; w = walk(kHub))
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    EXPECT_EQ(w.ports, std::vector<uint16_t>{7001});

    EXPECT_EQ(unregister_entry(mine), rpc__s_ok);
    EXPECT_TRUE(walk(kHub).ports.empty());
    broker.signal(SIGTERM);
    EXPECT_EQ(exit_code(broker.wait()), 0);
}

TEST(BrokerProgram, ListensOnIpv6AndStopsOnSigint)
{
    dpxtest::TempDir dir;
    dpxtest::Process broker = broker_program(dir, {"--listen", "::1"});
    std::optional<std::string> line = broker.wait_line("listening on [::1]:");
    ASSERT_TRUE(line);
    ScopedEnv port("NCS_LB_PORT", port_in(*line));

    lb__lookup_handle_t position = -1;
    Step step = lookup(kHub, position, 1, "::1");
    EXPECT_EQ(step.status, lb__s_not_registered);
    EXPECT_EQ(step.count, 0u);
    broker.signal(SIGINT);
    EXPECT_EQ(exit_code(broker.wait()), 0);
}

TEST(BrokerProgram, HelpNamesOptionsAndEnvironment)
{
    dpxtest::TempDir dir;
    dpxtest::Process help = broker_program(dir, {"--help"});
    EXPECT_EQ(exit_code(help.wait()), 0);
    help.wait_line("\n");  // no line holds a newline: returns at the end of the output
    std::vector<std::string> lines = help.lines();
    ASSERT_FALSE(lines.empty());
    EXPECT_EQ(lines[0], "usage: dpx-lbd [--listen HOST]");
    std::string text;
    for (const std::string &l : lines)
        text += l + "\n";
    for (const char *word : {"--listen", "NCS_LB_PORT", "TRC1_FLAGS", "TRC1_FILE", "listening on HOST:PORT"})
        EXPECT_NE(text.find(word), std::string::npos) << word;
}

}  // namespace
