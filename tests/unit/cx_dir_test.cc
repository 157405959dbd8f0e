// Directory records, making directories level by level, and file
// information, on real directories in a temporary tree.
#include "cx_test_file.h"
#include "cxfile.h"
#include "test_support.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <fcntl.h>
#include <string>
#include <sys/stat.h>

using dpxtest::cx_is;
using dpxtest::cx_ok;
using dpxtest::TempDir;

namespace {

// Sets the process's umask for the length of a scope.
class ScopedUmask {
public:
    explicit ScopedUmask(mode_t mask) : old_(umask(mask)) {}
    ~ScopedUmask() { umask(old_); }
    ScopedUmask(const ScopedUmask &) = delete;
    ScopedUmask &operator=(const ScopedUmask &) = delete;

private:
    mode_t old_;
};

mode_t permissions_of(const std::string &path)
{
    struct stat st {};
    EXPECT_EQ(stat(path.c_str(), &st), 0) << path;
    return st.st_mode & 07777;
}

bool is_directory(const std::string &path)
{
    struct stat st {};
    return stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

cx_dir_t dir_of(const std::string &path)
{
    cx_dir_t dir;
    EXPECT_TRUE(cx_ok(cx_dir_init(&dir, path.c_str())));
    return dir;
}

}  // namespace

TEST(CxDir, InitNormalisesSeparatorsAndKeepsAtMost254Characters)
{
    struct Case {
        std::string path;
        int32_t length;  // -1: refused with ENAMETOOLONG
        int32_t last_sep;
        std::string stored;
    };
    const Case cases[] = {
        {"", 0, -1, ""},
        {"C:\\tmp\\x", 8, 6, "C:/tmp/x"},
        {"/a/b/", 5, 4, "/a/b/"},
        {std::string(254, 'x'), 254, -1, std::string(254, 'x')},
        {std::string(255, 'x'), -1, -1, ""},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.path.substr(0, 20));
        cx_dir_t dir;
        cx_status status = cx_dir_init(&dir, c.path.c_str());
        EXPECT_EQ(dir.length, c.length);
        EXPECT_EQ(dir.last_sep, c.last_sep);
        if (c.length < 0) {
            EXPECT_TRUE(cx_is(status, 'p', ENAMETOOLONG));
            EXPECT_TRUE(cx_is(cx_dir_exists(&dir), 'p', EINVAL));
        } else {
            EXPECT_TRUE(cx_ok(status));
            EXPECT_EQ(std::string(dir.path), c.stored);
        }
    }
    cx_dir_t dir;
    EXPECT_TRUE(cx_is(cx_dir_init(&dir, nullptr), 'p', EINVAL));
    EXPECT_EQ(dir.length, -1);
}

TEST(CxDir, ParentsClimbToTheEmptyRecordAndStayThere)
{
    struct Case {
        std::string path;
        std::string parent;
        int32_t last_sep;
    };
    const Case cases[] = {
        {"/a/b", "/a", -1}, {"/a", "", -1}, {"", "", -1}, {"name", "", -1}, {"a/b/", "a/b", 1}, {"x/y/z", "x/y", 1},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.path);
        cx_dir_t dir = dir_of(c.path);
        cx_dir_t parent;
        ASSERT_TRUE(cx_ok(cx_dir_parent(&dir, &parent)));
        EXPECT_EQ(std::string(parent.path), c.parent);
        EXPECT_EQ(parent.length, static_cast<int32_t>(c.parent.size()));
        EXPECT_EQ(parent.last_sep, c.last_sep);
    }
}

TEST(CxDir, MkdirsMakesEachMissingLevelWithTheGivenModeWhateverTheUmask)
{
    TempDir tmp;
    ScopedUmask mask(0077);
    ASSERT_EQ(mkdir((tmp / "a").c_str(), 0700), 0);
    cx_dir_t dir = dir_of(tmp / "a/b/c");
    ASSERT_TRUE(cx_is(cx_dir_exists(&dir), 'p', ENOENT));
    ASSERT_TRUE(cx_ok(cx_dir_mkdirs(&dir, 0755)));
    EXPECT_EQ(permissions_of(tmp / "a"), 0700u) << "an existing level keeps its mode";
    EXPECT_EQ(permissions_of(tmp / "a/b"), 0755u);
    EXPECT_EQ(permissions_of(tmp / "a/b/c"), 0755u);
    EXPECT_TRUE(cx_ok(cx_dir_exists(&dir)));

    // Done already: nothing changes.
    EXPECT_TRUE(cx_ok(cx_dir_mkdirs(&dir, 0700)));
    EXPECT_EQ(permissions_of(tmp / "a/b/c"), 0755u);
}

TEST(CxDir, MkdirsBelowAPlainFileReportsNotADirectoryAndMakesNothing)
{
    TempDir tmp;
    dpxtest::write_file(tmp / "f", "x");
    cx_dir_t dir = dir_of(tmp / "f/x/y");
    EXPECT_TRUE(cx_is(cx_dir_mkdirs(&dir, 0777), 'p', ENOTDIR));
    EXPECT_FALSE(is_directory(tmp / "f"));
    EXPECT_EQ(dpxtest::read_file(tmp / "f"), "x");
}

TEST(CxDir, MkdirsForFileMakesTheDirectoriesAboveTheFileOpenToAll)
{
    TempDir tmp;
    ScopedUmask mask(0022);
    ASSERT_TRUE(cx_ok(cx_mkdirs_for_file((tmp / "d/e/file.txt").c_str())));
    EXPECT_EQ(permissions_of(tmp / "d"), 0777u);
    EXPECT_EQ(permissions_of(tmp / "d/e"), 0777u);
    EXPECT_FALSE(dpxtest::file_exists(tmp / "d/e/file.txt"));
    const std::string too_long = tmp.path() + "/" + std::string(250, 'n') + "/f";
    EXPECT_TRUE(cx_is(cx_mkdirs_for_file(too_long.c_str()), 'p', ENAMETOOLONG));
    EXPECT_TRUE(cx_is(cx_mkdirs_for_file("bare-name"), 'p', ENOENT));
}

TEST(CxFileInfo, GivesSizeAndSecondsOfTheFileOrTheErrnoOfTheQuery)
{
    TempDir tmp;
    dpxtest::write_file(tmp / "empty", "");
    dpxtest::write_file(tmp / "data", std::string(8193, 'd'));
    const struct timespec times[2] = {{1000000000, 0}, {1234567890, 999999999}};
    ASSERT_EQ(utimensat(AT_FDCWD, (tmp / "data").c_str(), times, 0), 0);

    cx_file_info_t info;
    uint64_t size = 99;
    int32_t seconds = 0;
    ASSERT_TRUE(cx_ok(cx_named_file_info((tmp / "empty").c_str(), &info)));
    EXPECT_TRUE(cx_ok(cx_file_info_size(&info, &size)));
    EXPECT_EQ(size, 0u);
    ASSERT_TRUE(cx_ok(cx_named_file_info((tmp / "data").c_str(), &info)));
    EXPECT_TRUE(cx_ok(cx_file_info_size(&info, &size)));
    EXPECT_TRUE(cx_ok(cx_file_info_last_mod(&info, &seconds)));
    EXPECT_EQ(size, 8193u);
    EXPECT_EQ(seconds, 1234567890);
    EXPECT_TRUE(cx_ok(cx_named_file_info(tmp.path().c_str(), &info))) << "a directory has a size too";

    EXPECT_TRUE(cx_is(cx_named_file_info((tmp / "missing").c_str(), &info), 'p', ENOENT));
    EXPECT_TRUE(cx_is(cx_named_file_info((tmp / "data/below").c_str(), &info), 'p', ENOTDIR));
    EXPECT_TRUE(cx_is(cx_file_info_size(&info, nullptr), 'p', EINVAL));
    EXPECT_TRUE(cx_is(cx_file_info_last_mod(nullptr, &seconds), 'p', EINVAL));
}
