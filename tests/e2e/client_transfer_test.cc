// Whole files between this process and a hub daemon: round trips of every
// buffer shape, the target of a get, and the temporary file of a get.
#include "client_hub.h"

#include <cstdlib>
#include <fcntl.h>
#include <sys/statvfs.h>
#include <unistd.h>

using dpxtest::ClientOfHub;
using dpxtest::compare_files;

namespace {

TEST(ClientTransfer, PutAndGetMoveFilesOfEveryBufferShapeUnchanged)
{
    ClientOfHub hub;
    // Empty; one byte; one chunk; 23 chunks and a remainder (one call);
    // 24 chunks (a second call of one empty record); 256 chunks (24, 128 and
    // 105 records); 25600 chunks (128-record buffers).
    for (size_t size : {0u, 1u, 4096u, 98303u, 98304u, 1u << 20, 100u << 20}) {
        SCOPED_TRACE(size);
        std::string name = "sizes/" + std::to_string(size) + ".bin";
        std::string source = hub.dir / "source.bin", target = hub.dir / "target.bin";
        dpxtest::write_file(source, dpxtest::pattern_bytes(size, static_cast<uint32_t>(size)));

        ASSERT_EQ(PutFile("node1", name.c_str(), source.c_str()), DPX_OK);
        EXPECT_EQ(compare_files(source, hub.depot_file(name)), "");
        ASSERT_EQ(GetFile("node1", name.c_str(), target.c_str()), DPX_OK);
        EXPECT_EQ(compare_files(source, target), "");
        EXPECT_TRUE(hub.temp_files().empty());
    }
}

TEST(ClientTransfer, AFileJustAbove4GiBMakesTheRoundTrip)
{
    if (std::getenv("DPX_SKIP_SLOW") != nullptr)
        GTEST_SKIP() << "slow: skipped while DPX_SKIP_SLOW is set";
    ClientOfHub hub;
    // The depot's copy and the fetched one are written out whole.
    struct statvfs fs;
    ASSERT_EQ(statvfs(hub.dir.path().c_str(), &fs), 0);
    uint64_t free_bytes = static_cast<uint64_t>(fs.f_bavail) * fs.f_frsize;
    if (free_bytes < 10'000'000'000ull)
        GTEST_SKIP() << "needs 10 GB of free disk space, " << free_bytes << " bytes free";

    // Sparse, with data at the start, across the 4 GiB mark and at the end.
    const uint64_t size = (4ull << 30) + 5000;
    std::string source = hub.dir / "big.bin", target = hub.dir / "big-copy.bin";
    {
        int fd = open(source.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
        ASSERT_GE(fd, 0);
        std::string bytes = dpxtest::pattern_bytes(12000, 7);
        const uint64_t offsets[] = {0, (4ull << 30) - 6000, size - bytes.size()};
        for (uint64_t offset : offsets)
            EXPECT_EQ(pwrite(fd, bytes.data(), bytes.size(), static_cast<off_t>(offset)),
                      static_cast<ssize_t>(bytes.size()));
        ASSERT_EQ(close(fd), 0);
    }

    dpx_status put = PutFile("node1", "big/big.bin", source.c_str());
    dpx_status get = put == DPX_OK ? GetFile("node1", "big/big.bin", target.c_str()) : put;
    std::remove(hub.depot_file("big/big.bin").c_str());
    EXPECT_EQ(put, DPX_OK);
    EXPECT_EQ(get, DPX_OK);
    EXPECT_EQ(compare_files(source, target), "");
    std::remove(target.c_str());
    std::remove(source.c_str());
}

// Each case gets a target that already holds other content, longer than the
// remote file, and ends with no temporary file.
struct GetCase {
    const char *what;
    const char *program;
    std::vector<std::string> peer_args;
    bool remote_exists;
    bool hub_down;
    dpx_status expected;
};

TEST(ClientTransfer, AGetReplacesItsTargetWholeOnSuccessOnlyAndLeavesNoTemporaryFile)
{
    const GetCase cases[] = {
        {"success", "dpx-agentd", {}, true, false, DPX_OK},
        {"missing remote file", "dpx-agentd", {}, false, false, DPX_E_FILE_READ},
        // No binding can be made: get_hub_handle's status.
        {"hub down", "dpx-agentd", {}, true, true, DPX_E_INVALID_PARAM},
        {"file changed during the download", "dpx_test_peer", {"--grow-after-get", "1"}, true, false,
         DPX_E_FILE_CHANGED},
        {"checksum failure", "dpx_test_peer", {"--corrupt-get", "2"}, true, false, DPX_E_CHECKSUM},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(c.what);
        ClientOfHub hub(c.peer_args, c.program);
        std::string content = dpxtest::pattern_bytes(300000, 3);
        if (c.remote_exists) {
            std::filesystem::create_directories(hub.depot + "/prod/d");
            dpxtest::write_file(hub.depot_file("d/remote.bin"), content);
        }
        std::string target = hub.dir / "target.bin";
        std::string old_content = dpxtest::pattern_bytes(400000, 4);
        dpxtest::write_file(target, old_content);
        if (c.hub_down)
            hub.daemon->stop();

        EXPECT_EQ(GetFile("node1", "d/remote.bin", target.c_str()), c.expected);
        EXPECT_TRUE(dpxtest::read_file(target) == (c.expected == DPX_OK ? content : old_content))
            << "the target holds neither the whole new content nor only the old one";
        EXPECT_TRUE(hub.temp_files().empty());
    }
}

TEST(ClientTransfer, APutOfAMissingSourceFailsBeforeTheHubIsAsked)
{
    ClientOfHub hub({}, "dpx_test_peer");
    dpxtest::TraceCapture trace(TRC1_FLOW | TRC1_ERROR);

    EXPECT_EQ(PutFile("node1", "x.bin", (hub.dir / "no-such-file").c_str()), DPX_E_FILE_READ);
    EXPECT_TRUE(trace.contains("Could not stat input_file"));
    EXPECT_FALSE(trace.contains("binding to"));
    EXPECT_EQ(hub.peer_lines("call "), 0u);
}

}  // namespace
