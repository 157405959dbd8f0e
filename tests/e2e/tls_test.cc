// TLS between hosts: a daemon with --tls-* takes only clients whose
// certificate its CA signed, the bytes on the wire are not the file's, and
// the daemon's rights refuse what they should. Certificates are made here
// with openssl; the clients are the dpx program.
#include "hub.h"

#include <sys/stat.h>

namespace {

using namespace dpxtest;

// A CA, and certificates it signs, in a directory of their own.
class Certificates {
public:
    Certificates() : ca_(make_ca("dpx test CA")) {}

    // Key and certificate "<name>.key", "<name>.pem" for `san`, signed by
    // this CA (or `by`); valid for a month, or expired a day ago.
    void issue(const std::string &name, const std::string &san, bool expired = false, const std::string &by = "ca")
    {
        openssl({"req", "-newkey", "ec", "-pkeyopt", "ec_paramgen_curve:P-256", "-nodes", "-keyout", key(name),
                 "-out", dir_ / (name + ".csr"), "-subj", "/CN=" + name});
        write_file(dir_ / (name + ".ext"), "subjectAltName=" + san + "\n");
        openssl({"x509", "-req", "-in", dir_ / (name + ".csr"), "-CA", pem(by), "-CAkey", key(by),
                 "-CAcreateserial", "-days", expired ? "-1" : "30", "-extfile", dir_ / (name + ".ext"), "-out",
                 pem(name)});
        chmod(key(name).c_str(), 0600);
    }
    std::string make_ca(const std::string &name)
    {
        const std::string id = name == "dpx test CA" ? "ca" : "otherca";
        openssl({"req", "-x509", "-newkey", "ec", "-pkeyopt", "ec_paramgen_curve:P-256", "-nodes", "-keyout",
                 key(id), "-out", pem(id), "-days", "30", "-subj", "/CN=" + name});
        return id;
    }
    std::string file(const std::string &name) const { return dir_ / name; }
    std::string pem(const std::string &name) const { return file(name + ".pem"); }
    std::string key(const std::string &name) const { return file(name + ".key"); }
    // The client's environment for certificate `name` ("" for none) and CA `ca`.
    Env client(const std::string &name, const std::string &ca = "ca") const
    {
        return {{"NCS_TLS_CERT", name.empty() ? std::nullopt : std::optional(pem(name))},
                {"NCS_TLS_KEY", name.empty() ? std::nullopt : std::optional(key(name))},
                {"NCS_TLS_CA", ca.empty() ? std::nullopt : std::optional(pem(ca))}};
    }

private:
    void openssl(std::vector<std::string> args)
    {
        args.insert(args.begin(), "/usr/bin/openssl");
        Ran made = run(args);
        ASSERT_TRUE(exited_with(made.wstatus, 0)) << made.err;
    }
    TempDir dir_;
    std::string ca_;
};

// The dpx program with `env` added: exit status, and its one line of failure.
Ran dpx(const Env &env, std::vector<std::string> args)
{
    args.insert(args.begin(), {bin_dir() + "/dpx", "--quiet"});
    return run(args, env);
}

class Tls : public ::testing::Test {
protected:
    void SetUp() override
    {
        if (access("/usr/bin/openssl", X_OK) != 0)
            GTEST_SKIP() << "needs openssl";
        certs.issue("server", "DNS:localhost,IP:127.0.0.1");
        certs.issue("client", "DNS:client");
        start({});
    }
    void start(std::vector<std::string> more)
    {
        hub.reset();
        std::vector<std::string> args = {"--tls-cert", certs.pem("server"), "--tls-key", certs.key("server"),
                                         "--tls-ca", certs.pem("ca")};
        args.insert(args.end(), more.begin(), more.end());
        hub = std::make_unique<Hub>(args);
    }
    Certificates certs;
    std::unique_ptr<Hub> hub;
};

TEST_F(Tls, ClientsWithoutAGoodCertificateAreRefusedAtOnceAndLeaveNothingBehind)
{
    certs.issue("expired", "DNS:client", true);
    certs.make_ca("another CA");
    certs.issue("stranger", "DNS:client", false, "otherca");
    write_file(hub->depot_file("kept.bin"), pattern_bytes(100000, 1));
    write_file(*hub / "new.bin", pattern_bytes(100000, 2));
    const struct { const char *who; Env env; const char *status; } refused[] = {
        {"a plain client", {}, "0x1C01000E"},
        {"a client without a certificate", certs.client(""), "0x1C01000F"},
        {"a certificate of another CA", certs.client("stranger"), "0x1C01000F"},
        {"an expired certificate", certs.client("expired"), "0x1C01000F"},
        {"a server certificate of another CA", certs.client("client", "otherca"), "0x1C010010"},
    };
    for (const auto &r : refused) {
        SCOPED_TRACE(r.who);
        auto started = std::chrono::steady_clock::now();
        Ran get = dpx(r.env, {"get", "node1", "kept.bin", *hub / "target.bin"});
        Ran put = dpx(r.env, {"put", "node1", "new.bin", *hub / "new.bin"});
        EXPECT_LT(std::chrono::steady_clock::now() - started, std::chrono::seconds(5));
        EXPECT_EQ(get.err.substr(0, 10), r.status) << get.err;
        EXPECT_EQ(put.err.substr(0, 10), r.status) << put.err;
        EXPECT_FALSE(file_exists(*hub / "target.bin"));
        EXPECT_FALSE(file_exists(hub->depot_file("new.bin")));
        EXPECT_TRUE(hub->temp_files().empty());
    }
}

TEST_F(Tls, AGoodCertificateMovesAFileBothWaysAndTheWireNeverCarriesItsBytes)
{
    const std::string content = pattern_bytes(2'000'000, 3);
    write_file(*hub / "source.bin", content);
    std::unique_ptr<Process> capture;
    if (access("/usr/bin/tcpdump", X_OK) == 0) {
        capture = std::make_unique<Process>(
            std::vector<std::string>{"/usr/bin/tcpdump", "-i", "lo", "-U", "-w", *hub / "wire.pcap", "tcp", "port",
                                     std::to_string(hub->port)},
            Env{}, *hub / "tcpdump.err");
        ASSERT_TRUE(eventually([&] { return read_file(*hub / "tcpdump.err").find("listening") != std::string::npos; }));
    }
    Ran put = dpx(certs.client("client"), {"put", "node1", "up.bin", *hub / "source.bin"});
    Ran get = dpx(certs.client("client"), {"get", "node1", "up.bin", *hub / "down.bin"});
    EXPECT_TRUE(exited_with(put.wstatus, 0)) << put.err;
    EXPECT_TRUE(exited_with(get.wstatus, 0)) << get.err;
    EXPECT_TRUE(same_files(*hub / "source.bin", hub->depot_file("up.bin")));
    EXPECT_TRUE(same_files(*hub / "source.bin", *hub / "down.bin"));
    if (capture == nullptr)
        GTEST_SKIP() << "the transfer passed; the capture needs tcpdump";
    capture->signal(SIGINT);
    capture->wait();
    const std::string wire = read_file(*hub / "wire.pcap");
    EXPECT_GT(wire.size(), 2 * content.size()) << "the capture missed the transfer";
    for (size_t at = 0; at + 64 <= content.size(); at += 100'000)
        EXPECT_EQ(wire.find(content.substr(at, 64)), std::string::npos) << "file bytes at " << at << " on the wire";
}

TEST_F(Tls, SighupReloadsTheFilesForNewConnectionsWithoutDroppingACallUnderWay)
{
    write_file(hub->depot_file("big.bin"), pattern_bytes(64u << 20, 4));
    Process get({bin_dir() + "/dpx", "--quiet", "get", "node1", "big.bin", *hub / "big.bin"}, certs.client("client"));
    // A certificate that no longer names this host, in place of the server's.
    certs.issue("server", "DNS:elsewhere");
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    hub->daemon->signal(SIGHUP);
    EXPECT_TRUE(exited_with(get.wait(std::chrono::seconds(120)), 0));
    EXPECT_TRUE(same_files(hub->depot_file("big.bin"), *hub / "big.bin"));
    Ran after = dpx(certs.client("client"), {"get", "node1", "big.bin", *hub / "again.bin"});
    EXPECT_EQ(after.err.substr(0, 10), "0x1C010010") << after.err;
}

TEST_F(Tls, TheRightsFileDeclinesWhatItDoesNotGrantByTheCertificatesName)
{
    certs.issue("reader", "DNS:reader");
    write_file(certs.file("rights"), "# NAME RIGHTS NODES PATHS\n"
                               "client  read,write  node1,node2  conf/ notes.txt\n"
                               "reader  read        *            *\n");
    start({"--rights", certs.file("rights")});
    made_dir(hub->depot_file("secret"));
    write_file(hub->depot_file("secret/key"), "secret");
    write_file(*hub / "new.cfg", "new");
    const struct { const char *who, *op, *node, *path; bool allowed; } calls[] = {
        {"client", "put", "node1", "conf/app.cfg", true},
        {"client", "put", "node2", "./conf/../notes.txt", true},
        {"client", "get", "node1", "conf/app.cfg", true},
        {"client", "put", "node3", "conf/app.cfg", false},
        {"client", "put", "node1", "conf/../secret/key", false},
        {"client", "get", "node1", "secret/key", false},
        {"client", "put", "node1", "notes.txt.d/x", false},
        {"reader", "get", "node9", "secret/key", true},
        {"reader", "put", "node1", "conf/app.cfg", false},
    };
    for (const auto &c : calls) {
        SCOPED_TRACE(std::string(c.who) + " " + c.op + " " + c.node + " " + c.path);
        Ran ran = dpx(certs.client(c.who), {c.op, c.node, c.path, *hub / (std::string(c.op) == "put" ? "new.cfg" : "got")});
        EXPECT_TRUE(exited_with(ran.wstatus, c.allowed ? 0 : 1)) << ran.err;
        if (!c.allowed) {
            EXPECT_EQ(ran.err.substr(0, 10), "0xF11E0011") << ran.err;
        }
        EXPECT_EQ(read_file(hub->depot_file("secret/key")), "secret");
    }
    EXPECT_EQ(read_file(hub->depot_file("conf/app.cfg")), "new");
}

TEST(Rights, AReadOnlyDaemonDeclinesEveryPutAndLeavesTheDepotAsItWas)
{
    Hub hub({"--read-only"});
    write_file(hub.depot_file("kept.bin"), "before");
    write_file(hub / "more.bin", "after");
    Ran put = dpx({}, {"put", "node1", "kept.bin", hub / "more.bin"});
    EXPECT_TRUE(exited_with(put.wstatus, 1));
    EXPECT_EQ(put.err.substr(0, 10), "0xF11E0011") << put.err;
    EXPECT_EQ(read_file(hub.depot_file("kept.bin")), "before");
    Ran get = dpx({}, {"get", "node1", "kept.bin", hub / "copy.bin"});
    EXPECT_TRUE(exited_with(get.wstatus, 0)) << get.err;
}

}  // namespace
