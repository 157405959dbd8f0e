// Depot paths: cleaning of relative paths, the cached depot root and product
// name, and the composed full path. The root and product are cached for the
// life of a process, so every case that looks them up runs in a child.
#include "child.h"
#include "dpxserver.h"

#include "afw/afw.h"
#include "dpx/dpx.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <thread>
#include <vector>

namespace {

using dpxtest::in_child;

// A text for comparisons that also takes a null pointer.
std::string text_of(const char *text)
{
    return text != nullptr ? text : "(null)";
}

TEST(CleanRelPath, GivesTheOutputOfEveryRowOfTheTable)
{
    const struct { std::string in, out; } rows[] = {
        {"", ""}, {".", ""}, {"..", ""}, {"/", ""}, {"a", "a"}, {"a/", "a/"}, {"a//b", "a/b"}, {"a\\b", "a/b"},
        {"/a", "a"}, {"\\\\a", "a"}, {"./a", "a"}, {"../a", "a"}, {"../../a", "a"}, {"a/..", ""}, {"a/../b", "b"},
        {"a/b/..", "a/"}, {"a/b/../c", "a/c"}, {"a/b/../../c", "c"}, {"a/b/../../../c", "c"},
        {"x/../../../etc/passwd", "etc/passwd"}, {"/etc/passwd", "etc/passwd"},
        {"..\\..\\etc\\passwd", "etc/passwd"}, {"a/./b", "a/b"}, {"a/.", "a/"}, {"a/.//b", "a//b"},
        {"a/...", "a/..."}, {"a/..b/c", "a/..b/c"}, {"C:\\x", "C:/x"},
        // The rows told after the table.
        {"a/.//../b", "a/b"}, {"..a/.a/...", "..a/.a/..."}, {"a\\..\\..\\b/./../c", "c"}, {"//..//..//", ""}};
    for (const auto &row : rows) {
        // Room for the input and its NUL only: ASan sees a write past it.
        std::vector<char> out(row.in.size() + 1, '#');
        EXPECT_EQ(dpx_cleanup_rel_path(row.in.c_str(), out.data()), DPX_OK);
        EXPECT_EQ(out.data(), row.out) << "input [" << row.in << "]";
    }
}

// Each row is a process: both texts are looked for again while missing,
// then many threads make the first use at once, then the texts are kept.
TEST(DepotRoot, ComesFromDpxDepotrootElseVesperhomeWholeToEveryThreadAndIsKeptOnceFound)
{
    const std::string long_root = "/" + std::string(3000, 'r');
    const struct { const char *depotroot, *vesperhome; std::string root; } rows[] = {
        {"/d", nullptr, "/d"}, {nullptr, "/h", "/h/dpxdepot"}, {"/d", "/h", "/d"}, {"", "/h", ""},
        {"/d/", nullptr, "/d/"}, {long_root.c_str(), nullptr, long_root}};
    for (const auto &row : rows) {
        const auto body = [&row]() -> std::string {
            for (const char *name : {"DPX_DEPOTROOT", "VESPERHOME", "AFW_PRODUCT"})
                unsetenv(name);
            char full[4096] = "";
            // The depot is tested before the arguments.
            if (dpx_get_depotroot() != nullptr || dpx_get_product() != nullptr ||
                dpx_get_full_path(nullptr, full, sizeof full) != DPX_E_NO_DEPOT)
                return "depot found while unset";
            if (row.depotroot != nullptr)
                setenv("DPX_DEPOTROOT", row.depotroot, 1);
            if (row.vesperhome != nullptr)
                setenv("VESPERHOME", row.vesperhome, 1);
            AFW_SetProductName("p");
            std::vector<std::string> seen(8);
            std::vector<std::jthread> threads;
            for (std::string &out : seen)
                threads.emplace_back([&out] { out = text_of(dpx_get_depotroot()) + "|" + text_of(dpx_get_product()); });
            threads.clear();
            for (const std::string &texts : seen)
                if (texts != row.root + "|p")
                    return "a thread saw " + texts.substr(0, 40);
            setenv("DPX_DEPOTROOT", "/second", 1);
            AFW_SetProductName("other");
            if (dpx_get_full_path("x", full, sizeof full) != DPX_OK || full != row.root + "/p/x")
                return std::string("full path ") + full;
            return "";
        };
        EXPECT_EQ(in_child(body), "") << row.root.substr(0, 20);
    }
}

TEST(FullPath, JoinsRootProductAndCleanedPathWhileTheyFitIn4095Characters)
{
    const auto body = []() -> std::string {
        setenv("DPX_DEPOTROOT", "/d", 1);
        unsetenv("AFW_PRODUCT");
        char full[4096];
        if (dpx_get_full_path("a", full, sizeof full) != DPX_E_NO_DEPOT)
            return "missing product accepted";
        AFW_SetProductName("p");
        // "/d/p/" takes 5 characters. An empty full path stands for DPX_E_PATH_TOO_LONG.
        const struct { std::string rel, full; } rows[] = {
            {"../../etc/passwd", "/d/p/etc/passwd"}, {"conf\\a.cfg", "/d/p/conf/a.cfg"}, {"", "/d/p/"},
            {std::string(4090, 'f'), "/d/p/" + std::string(4090, 'f')}, {std::string(4091, 'f'), ""},
            {std::string(10000, 'g'), ""}};
        for (const auto &row : rows) {
            const dpx_status status = dpx_get_full_path(row.rel.c_str(), full, sizeof full);
            if (status != (row.full.empty() ? DPX_E_PATH_TOO_LONG : DPX_OK) || (status == DPX_OK && full != row.full))
                return "wrong outcome for " + row.rel.substr(0, 20);
        }
        // The field is the whole allocation: ASan sees a read past it.
        std::vector<char> field(DPX_PATH_LEN, 'a');
        if (dpx_get_full_path_of_field(field.data(), field.size(), full, sizeof full) != DPX_E_INVALID_PARAM)
            return "field without NUL accepted";
        field[10] = '\0';
        if (dpx_get_full_path_of_field(field.data(), field.size(), full, sizeof full) != DPX_OK ||
            full != std::string("/d/p/aaaaaaaaaa"))
            return "terminated field refused";
        return "";
    };
    EXPECT_EQ(in_child(body), "");
}

}  // namespace
