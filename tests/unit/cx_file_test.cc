// File access through cx_ handles, and temporary files, delete, move and
// copy, on real files in temporary directories.
#include "cx_test_file.h"
#include "test_support.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <cstdlib>
#include <fcntl.h>
#include <memory>
#include <string>
#include <sys/stat.h>
#include <unistd.h>

using dpxtest::cx_is;
using dpxtest::cx_ok;
using dpxtest::CxFile;
using dpxtest::file_exists;
using dpxtest::read_file;
using dpxtest::TempDir;
using dpxtest::write_file;

namespace {

std::string read_at(CxFile &file, uint64_t position, size_t count)
{
    std::string bytes(count, '\0');
    size_t done = 0;
    EXPECT_TRUE(cx_ok(cx_file_set_pos(file.get(), &position)));
    EXPECT_TRUE(cx_ok(cx_file_read_bytes(file.get(), count, &done, bytes.data())));
    bytes.resize(done);
    return bytes;
}

}  // namespace

TEST(CxFileAccess, ShortCountsComeOnlyAtTheEndOfTheFile)
{
    TempDir tmp;
    write_file(tmp / "f", dpxtest::pattern_bytes(4196));
    CxFile file;
    ASSERT_TRUE(cx_ok(file.open(tmp / "f", CX_FILE_READ)));
    EXPECT_EQ(read_at(file, 4096, 4096), dpxtest::pattern_bytes(4196).substr(4096));
    EXPECT_EQ(read_at(file, 4196, 4096), "");
    EXPECT_EQ(read_at(file, 1u << 20, 10), "") << "a position past the end is accepted";
    EXPECT_EQ(read_at(file, 0, 4096).size(), 4096u);

    size_t done = 77;
    char byte = 0;
    EXPECT_TRUE(cx_ok(cx_file_read_bytes(file.get(), 0, &done, &byte)));
    EXPECT_EQ(done, 0u);
    EXPECT_TRUE(cx_is(cx_file_read_bytes(file.get(), 1, nullptr, &byte), 'p', EINVAL));
}

TEST(CxFileAccess, AFailedReadOrWriteReportsErrnoAndLeavesTheCountAlone)
{
    TempDir tmp;
    write_file(tmp / "f", "content");
    char bytes[16] = {};
    size_t done = 77;
    CxFile writer;
    ASSERT_TRUE(cx_ok(writer.open(tmp / "g", CX_FILE_WRITE)));
    EXPECT_TRUE(cx_is(cx_file_read_bytes(writer.get(), sizeof bytes, &done, bytes), 'p', EBADF));
    CxFile reader;
    ASSERT_TRUE(cx_ok(reader.open(tmp / "f", CX_FILE_READ)));
    EXPECT_TRUE(cx_is(cx_file_write_bytes(reader.get(), sizeof bytes, &done, bytes), 'p', EBADF));
    EXPECT_EQ(done, 77u);
}

TEST(CxFileAccess, UnknownModesAreRefusedBeforeAnyDirectoryIsMade)
{
    TempDir tmp;
    for (int32_t mode : {0, 0x12, 0x02}) {
        CxFile file;
        EXPECT_TRUE(cx_is(file.open(tmp / "new/f", mode), 'p', EINVAL)) << mode;
        EXPECT_FALSE(file_exists(tmp / "new"));
    }
    CxFile file;
    EXPECT_TRUE(cx_is(file.open(tmp / "new/f", CX_FILE_READ), 'p', ENOENT));
    EXPECT_FALSE(file_exists(tmp / "new"));
    ASSERT_TRUE(cx_ok(file.open(tmp / "new/sub/f", CX_FILE_WRITE)));
    EXPECT_EQ(read_file(tmp / "new/sub/f"), "");
}

TEST(CxFileAccess, AppendKeepsTheContentWhileWriteEmptiesItAtTheOpen)
{
    TempDir tmp;
    write_file(tmp / "f", "abc");
    size_t done = 0;
    CxFile file;
    ASSERT_TRUE(cx_ok(file.open(tmp / "f", CX_FILE_APPEND)));
    ASSERT_TRUE(cx_ok(cx_file_write_bytes(file.get(), 3, &done, "def")));
    EXPECT_EQ(done, 3u);
    ASSERT_TRUE(cx_ok(file.close()));
    EXPECT_EQ(read_file(tmp / "f"), "abcdef");

    ASSERT_TRUE(cx_ok(file.open(tmp / "f", CX_FILE_WRITE)));
    EXPECT_EQ(read_file(tmp / "f"), "");
    ASSERT_TRUE(cx_ok(cx_file_write_bytes(file.get(), 1, &done, "x")));
    ASSERT_TRUE(cx_ok(file.close()));
    EXPECT_EQ(read_file(tmp / "f"), "x");
}

TEST(CxFileAccess, PositionsBeyondTwoAndFourGiBReachTheFileWhole)
{
    TempDir tmp;
    const std::string path = tmp / "sparse";
    // Each mark straddles a boundary where a narrower offset would wrap.
    const uint64_t positions[] = {(1ull << 31) - 3, (1ull << 32) - 2, (1ull << 32) + 3 * 4096 + 5, 5ull << 30};
    auto mark = [](uint64_t position) { return "mark@" + std::to_string(position); };
    CxFile out;
    ASSERT_TRUE(cx_ok(out.open(path, CX_FILE_WRITE)));
    for (uint64_t position : positions) {
        std::string text = mark(position);
        size_t done = 0;
        ASSERT_TRUE(cx_ok(cx_file_set_pos(out.get(), &position)));
        ASSERT_TRUE(cx_ok(cx_file_write_bytes(out.get(), text.size(), &done, text.data())));
    }
    ASSERT_TRUE(cx_ok(out.close()));

    int fd = open(path.c_str(), O_RDONLY);
    ASSERT_GE(fd, 0);
    CxFile in;
    ASSERT_TRUE(cx_ok(in.open(path, CX_FILE_READ)));
    for (uint64_t position : positions) {
        std::string text = mark(position);
        std::string on_disk(text.size(), '\0');
        EXPECT_EQ(pread(fd, on_disk.data(), on_disk.size(), static_cast<off_t>(position)),
                  static_cast<ssize_t>(text.size()));
        EXPECT_EQ(on_disk, text);
        EXPECT_EQ(read_at(in, position, text.size()), text);
    }
    close(fd);
    cx_file_info_t info;
    uint64_t size = 0;
    ASSERT_TRUE(cx_ok(cx_named_file_info(path.c_str(), &info)));
    ASSERT_TRUE(cx_ok(cx_file_info_size(&info, &size)));
    EXPECT_EQ(size, (5ull << 30) + mark(5ull << 30).size());
}

TEST(CxTempFile, TwoCallsGiveDifferentOpenFilesNamedCxp)
{
    TempDir tmp;
    dpxtest::ScopedEnv env("TMPDIR", tmp.path());
    char *names[2] = {nullptr, nullptr};
    for (char *&name : names) {
        cx_os_file_t file;
        ASSERT_TRUE(cx_ok(cx_temp_file(nullptr, &name, &file)));
        CxFile owned(file.stream);
        size_t done = 0;
        EXPECT_TRUE(cx_ok(cx_file_write_bytes(owned.get(), 2, &done, "ok")));
        ASSERT_NE(name, nullptr);
        std::string base = std::string(name).substr(std::string(name).rfind('/') + 1);
        EXPECT_EQ(base.rfind("cxp", 0), 0u) << name;
    }
    EXPECT_STRNE(names[0], names[1]);
    for (char *name : names) {
        EXPECT_EQ(read_file(name), "ok");
        EXPECT_TRUE(cx_ok(cx_delete_file(name)));
        EXPECT_FALSE(file_exists(name));
        std::free(name);
    }
    cx_os_file_t file;
    EXPECT_TRUE(cx_is(cx_temp_file(nullptr, nullptr, &file), 'p', EINVAL));
}

TEST(CxMove, MakesMissingDirectoriesAndReplacesAnExistingDestination)
{
    TempDir tmp;
    write_file(tmp / "a", "first");
    ASSERT_TRUE(cx_ok(cx_move_file((tmp / "a").c_str(), (tmp / "x/y/b").c_str())));
    EXPECT_EQ(read_file(tmp / "x/y/b"), "first");
    EXPECT_FALSE(file_exists(tmp / "a"));

    write_file(tmp / "c", "second");
    ASSERT_TRUE(cx_ok(cx_move_file((tmp / "c").c_str(), (tmp / "x/y/b").c_str())));
    EXPECT_EQ(read_file(tmp / "x/y/b"), "second");

    EXPECT_TRUE(cx_is(cx_move_file((tmp / "gone").c_str(), (tmp / "x/z").c_str()), 'p', ENOENT));
    EXPECT_FALSE(file_exists(tmp / "x/z"));
}

TEST(CxMove, AcrossFileSystemsCopiesTheContentAndRemovesTheSource)
{
    TempDir tmp;
    struct stat here {};
    struct stat shm {};
    ASSERT_EQ(stat(tmp.path().c_str(), &here), 0);
    if (stat("/dev/shm", &shm) != 0 || access("/dev/shm", W_OK) != 0 || shm.st_dev == here.st_dev)
        GTEST_SKIP() << "no second writable file system: /dev/shm is missing, read-only or on the same device";
    std::unique_ptr<TempDir> other;
    {
        dpxtest::ScopedEnv env("TMPDIR", "/dev/shm");
        other = std::make_unique<TempDir>();
    }
    const std::string content = dpxtest::pattern_bytes(100000);
    write_file(tmp / "src", content);
    ASSERT_TRUE(cx_ok(cx_move_file((tmp / "src").c_str(), (*other / "d/dst").c_str())));
    EXPECT_EQ(read_file(*other / "d/dst"), content);
    EXPECT_FALSE(file_exists(tmp / "src"));
}

TEST(CxCopy, CarriesContentOfAnySizeAndLeavesTheSource)
{
    TempDir tmp;
    for (size_t size : {0u, 8191u, 8192u, 20000u}) {
        const std::string content = dpxtest::pattern_bytes(size, static_cast<uint32_t>(size));
        write_file(tmp / "src", content);
        write_file(tmp / "dst", std::string(30000, 'o'));
        ASSERT_TRUE(cx_ok(cx_copy_file((tmp / "src").c_str(), (tmp / "dst").c_str()))) << size;
        EXPECT_EQ(read_file(tmp / "dst"), content) << size;
        EXPECT_EQ(read_file(tmp / "src"), content) << size;
    }
}

TEST(CxCopy, AMissingSourceLeavesTheDestinationAloneButMakesItsDirectories)
{
    TempDir tmp;
    write_file(tmp / "dst", "keep");
    EXPECT_TRUE(cx_is(cx_copy_file((tmp / "missing").c_str(), (tmp / "dst").c_str()), 'p', ENOENT));
    EXPECT_EQ(read_file(tmp / "dst"), "keep");
    EXPECT_TRUE(cx_is(cx_copy_file((tmp / "missing").c_str(), (tmp / "m/n/dst").c_str()), 'p', ENOENT));
    EXPECT_TRUE(file_exists(tmp / "m/n"));
    EXPECT_FALSE(file_exists(tmp / "m/n/dst"));
}
