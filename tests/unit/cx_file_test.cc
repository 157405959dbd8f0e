// The file layer on real files in temporary directories: directories made
// level by level, file access, temporary files, move and copy.
#include "cx_test_file.h"
#include "test_support.h"

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <fcntl.h>
#include <sys/stat.h>
#include <tuple>
#include <unistd.h>

using namespace dpxtest;

namespace {

mode_t permissions_of(const std::string &path)
{
    struct stat st {};
    EXPECT_EQ(stat(path.c_str(), &st), 0) << path;
    return st.st_mode & 07777;
}

std::string read_at(CxFile &file, uint64_t position, size_t count)
{
    std::string bytes(count, '\0');
    size_t done = 0;
    EXPECT_TRUE(cx_ok(cx_file_set_pos(file.get(), &position)));
    EXPECT_TRUE(cx_ok(cx_file_read_bytes(file.get(), count, &done, bytes.data())));
    return bytes.substr(0, done);
}

TEST(CxDir, InitKeepsUpTo254CharactersWithSlashesAndParentsClimbToTheEmptyRecord)
{
    // A length of -1 stands for a refusal with ENAMETOOLONG.
    const struct { std::string path, stored, parent; int32_t length, last_sep, parent_sep; } rows[] = {
        {"", "", "", 0, -1, -1}, {"C:\\tmp\\x", "C:/tmp/x", "C:/tmp", 8, 6, 2}, {"/a/b/", "/a/b/", "/a/b", 5, 4, 2},
        {"/a/b", "/a/b", "/a", 4, 2, -1}, {"/a", "/a", "", 2, 0, -1}, {"name", "name", "", 4, -1, -1},
        {std::string(254, 'x'), std::string(254, 'x'), "", 254, -1, -1}, {std::string(255, 'x'), "", "", -1, -1, -1}};
    for (const auto &row : rows) {
        cx_dir_t dir, parent;
        const cx_status status = cx_dir_init(&dir, row.path.c_str());
        EXPECT_TRUE(row.length < 0 ? cx_is(status, 'p', ENAMETOOLONG) : cx_ok(status)) << row.path;
        EXPECT_TRUE(dir.length == row.length && dir.last_sep == row.last_sep) << row.path;
        if (row.length < 0)
            continue;
        EXPECT_EQ(dir.path, row.stored);
        ASSERT_TRUE(cx_ok(cx_dir_parent(&dir, &parent)));
        EXPECT_TRUE(parent.path == row.parent && parent.length == int32_t(row.parent.size()) &&
                    parent.last_sep == row.parent_sep)
            << row.path << " -> " << parent.path << " " << parent.length << " " << parent.last_sep;
    }
}

TEST(CxDir, MkdirsMakesEachMissingLevelWithItsModeWhateverTheUmaskButNothingBelowAFile)
{
    TempDir tmp;
    const mode_t old_mask = umask(0077);
    EXPECT_EQ(mkdir((tmp / "a").c_str(), 0700), 0);
    cx_dir_t dir;
    EXPECT_TRUE(cx_ok(cx_dir_init(&dir, (tmp / "a/b/c").c_str())));
    EXPECT_TRUE(cx_is(cx_dir_exists(&dir), 'p', ENOENT));
    // A second time changes nothing.
    EXPECT_TRUE(cx_ok(cx_dir_mkdirs(&dir, 0755)) && cx_ok(cx_dir_mkdirs(&dir, 0700)));
    umask(old_mask);
    EXPECT_EQ(std::tuple(permissions_of(tmp / "a"), permissions_of(tmp / "a/b"), permissions_of(tmp / "a/b/c")),
              std::tuple(0700u, 0755u, 0755u));
    write_file(tmp / "f", "x");
    ASSERT_TRUE(cx_ok(cx_dir_init(&dir, (tmp / "f/x/y").c_str())));
    EXPECT_TRUE(cx_is(cx_dir_mkdirs(&dir, 0777), 'p', ENOTDIR));
    EXPECT_EQ(read_file(tmp / "f"), "x");
}

TEST(CxFileAccess, ShortCountsComeOnlyAtTheEndOfTheFile)
{
    TempDir tmp;
    const std::string content = pattern_bytes(4196);
    write_file(tmp / "f", content);
    CxFile file;
    ASSERT_TRUE(cx_ok(file.open(tmp / "f", CX_FILE_READ)));
    EXPECT_EQ(read_at(file, 0, 4096), content.substr(0, 4096));
    EXPECT_EQ(read_at(file, 4096, 4096), content.substr(4096));
    EXPECT_EQ(read_at(file, 4196, 4096), "");
    EXPECT_EQ(read_at(file, 1u << 20, 10), "") << "a position past the end is accepted";
    size_t done = 77;
    EXPECT_TRUE(cx_ok(cx_file_read_bytes(file.get(), 0, &done, &done)) && done == 0);
}

TEST(CxFileAccess, UnknownModesAreRefusedOnlyWritingModesMakeDirectoriesAndOnlyAppendKeepsTheContent)
{
    TempDir tmp;
    CxFile file;
    size_t done = 0;
    for (int32_t mode : {0, 0x12, 0x02})
        EXPECT_TRUE(cx_is(file.open(tmp / "new/f", mode), 'p', EINVAL)) << mode;
    EXPECT_TRUE(cx_is(file.open(tmp / "new/f", CX_FILE_READ), 'p', ENOENT));
    EXPECT_FALSE(file_exists(tmp / "new"));
    ASSERT_TRUE(cx_ok(file.open(tmp / "new/sub/f", CX_FILE_WRITE)));
    EXPECT_EQ(read_file(tmp / "new/sub/f"), "");
    EXPECT_TRUE(cx_ok(cx_file_write_bytes(file.get(), 3, &done, "abc")) && cx_ok(file.close()));
    ASSERT_TRUE(cx_ok(file.open(tmp / "new/sub/f", CX_FILE_APPEND)));
    EXPECT_TRUE(cx_ok(cx_file_write_bytes(file.get(), 3, &done, "def")) && cx_ok(file.close()));
    EXPECT_EQ(read_file(tmp / "new/sub/f"), "abcdef");
    ASSERT_TRUE(cx_ok(file.open(tmp / "new/sub/f", CX_FILE_WRITE)));
    EXPECT_EQ(read_file(tmp / "new/sub/f"), "");
}

// Each mark straddles a boundary where a narrower offset would wrap. The
// chunk reads show the reading side of such positions.
TEST(CxFileAccess, WritesAtPositionsBeyondTwoAndFourGiBLandThere)
{
    TempDir tmp;
    const uint64_t positions[] = {(1ull << 31) - 3, (1ull << 32) - 2, (1ull << 32) + 3 * 4096 + 5, 5ull << 30};
    CxFile out;
    ASSERT_TRUE(cx_ok(out.open(tmp / "sparse", CX_FILE_WRITE)));
    for (uint64_t position : positions) {
        size_t done = 0;
        ASSERT_TRUE(cx_ok(cx_file_set_pos(out.get(), &position)) &&
                    cx_ok(cx_file_write_bytes(out.get(), sizeof position, &done, &position)));
    }
    ASSERT_TRUE(cx_ok(out.close()));
    const int fd = open((tmp / "sparse").c_str(), O_RDONLY);
    for (uint64_t position : positions) {
        uint64_t mark = 0;
        EXPECT_TRUE(pread(fd, &mark, sizeof mark, off_t(position)) == 8 && mark == position) << position;
    }
    close(fd);
}

TEST(CxTempFile, TwoCallsGiveDifferentOpenFilesNamedCxpInTheTemporaryDirectory)
{
    TempDir tmp;
    ScopedEnv env("TMPDIR", tmp.path());
    std::string names[2];
    for (std::string &name : names) {
        char *text = nullptr;
        size_t done = 0;
        CxFile file;
        ASSERT_TRUE(cx_ok(cx_temp_file(nullptr, &text, file.get())) && text != nullptr);
        name = text;
        std::free(text);
        EXPECT_TRUE(cx_ok(cx_file_write_bytes(file.get(), 2, &done, "ok")) && cx_ok(file.close()));
        EXPECT_TRUE(name.rfind(tmp.path() + "/cxp", 0) == 0 && read_file(name) == "ok") << name;
    }
    EXPECT_NE(names[0], names[1]);
    EXPECT_TRUE(cx_ok(cx_delete_file(names[0].c_str())) && !file_exists(names[0]));
}

TEST(CxMove, MakesMissingDirectoriesReplacesTheDestinationAndCrossesFileSystems)
{
    TempDir tmp;
    write_file(tmp / "a", "first");
    write_file(tmp / "c", "second");
    ASSERT_TRUE(cx_ok(cx_move_file((tmp / "a").c_str(), (tmp / "x/y/b").c_str())));
    ASSERT_TRUE(cx_ok(cx_move_file((tmp / "c").c_str(), (tmp / "x/y/b").c_str())));
    EXPECT_EQ(read_file(tmp / "x/y/b"), "second");
    EXPECT_FALSE(file_exists(tmp / "a") || file_exists(tmp / "c"));
    EXPECT_TRUE(cx_is(cx_move_file((tmp / "gone").c_str(), (tmp / "x/z").c_str()), 'p', ENOENT));
    EXPECT_FALSE(file_exists(tmp / "x/z"));
    // A bare destination is a name in the working directory.
    char *cwd = getcwd(nullptr, 0);
    ASSERT_EQ(chdir(tmp.path().c_str()), 0);
    EXPECT_TRUE(cx_ok(cx_move_file("x/y/b", "bare")));
    EXPECT_EQ(chdir(cwd), 0);
    std::free(cwd);
    EXPECT_EQ(read_file(tmp / "bare"), "second");

    struct stat here {}, shm {};
    if (stat(tmp.path().c_str(), &here) != 0 || stat("/dev/shm", &shm) != 0 || access("/dev/shm", W_OK) != 0 ||
        shm.st_dev == here.st_dev)
        GTEST_SKIP() << "no second writable file system: /dev/shm is missing, read-only or on the same device";
    ScopedEnv env("TMPDIR", "/dev/shm");
    TempDir other;
    const std::string content = pattern_bytes(100000);
    write_file(tmp / "src", content);
    ASSERT_TRUE(cx_ok(cx_move_file((tmp / "src").c_str(), (other / "d/dst").c_str())));
    EXPECT_EQ(read_file(other / "d/dst"), content);
    EXPECT_FALSE(file_exists(tmp / "src"));
}

TEST(CxCopy, ReplacesTheDestinationWithTheSourceOrLeavesItWhenTheSourceIsMissing)
{
    TempDir tmp;
    for (size_t size : {0u, 8191u, 8192u, 20000u}) {
        const std::string content = pattern_bytes(size, static_cast<uint32_t>(size));
        write_file(tmp / "src", content);
        write_file(tmp / "dst", std::string(30000, 'o'));
        ASSERT_TRUE(cx_ok(cx_copy_file((tmp / "src").c_str(), (tmp / "dst").c_str()))) << size;
        EXPECT_TRUE(read_file(tmp / "dst") == content && read_file(tmp / "src") == content) << size;
    }
    EXPECT_TRUE(cx_is(cx_copy_file((tmp / "missing").c_str(), (tmp / "dst").c_str()), 'p', ENOENT));
    EXPECT_EQ(read_file(tmp / "dst"), pattern_bytes(20000, 20000));
    EXPECT_TRUE(cx_is(cx_copy_file((tmp / "missing").c_str(), (tmp / "m/n/dst").c_str()), 'p', ENOENT));
    EXPECT_TRUE(file_exists(tmp / "m/n") && !file_exists(tmp / "m/n/dst"));
}

TEST(CxTraceLog, IndentsPointsBetweenEnterAndLeaveAndLeavesTheLogAsItWas)
{
    const char *log = "/dpx-debug.log";
    if (access("/", W_OK) != 0)
        GTEST_SKIP() << "the root directory is not writable here";
    struct stat before {};
    bool existed = stat(log, &before) == 0;
    cxIntlTraceEnter("f %d\n", 1);
    cxIntlTracePoint("step\n");
    cxIntlTraceLeave("f\n");
    std::string text = read_file(log);
    size_t start = existed ? static_cast<size_t>(before.st_size) : 0;
    EXPECT_EQ(text.substr(std::min(start, text.size())), "ENTER f 1\n   ... step\nLEAVE f\n");
    if (existed)
        EXPECT_EQ(truncate(log, before.st_size), 0);
    else
        EXPECT_EQ(unlink(log), 0);
}

}  // namespace
