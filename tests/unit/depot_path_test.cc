// Depot paths: cleaning of relative paths, the cached depot root and product
// name, and the composed full path.
#include "child.h"
#include "dpxserver.h"
#include "test_support.h"

#include "afw/afw.h"
#include "dpx/dpx.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <string>
#include <thread>
#include <vector>

namespace {

using dpxtest::in_child;

struct CleanRow {
    const char *in;
    const char *out;
};

class CleanRelPath : public ::testing::TestWithParam<CleanRow> {};

TEST_P(CleanRelPath, GivesTheTableOutput)
{
    std::string in = GetParam().in;
    std::vector<char> clean(in.size() + 1, '#');
    ASSERT_EQ(dpx_cleanup_rel_path(in.c_str(), clean.data()), DPX_OK);
    EXPECT_STREQ(clean.data(), GetParam().out) << "input [" << in << "]";
}

INSTANTIATE_TEST_SUITE_P(
    Table, CleanRelPath,
    ::testing::Values(CleanRow{"", ""}, CleanRow{".", ""}, CleanRow{"..", ""}, CleanRow{"/", ""},
                      CleanRow{"a", "a"}, CleanRow{"a/", "a/"}, CleanRow{"a//b", "a/b"}, CleanRow{"a\\b", "a/b"},
                      CleanRow{"/a", "a"}, CleanRow{"\\\\a", "a"}, CleanRow{"./a", "a"}, CleanRow{"../a", "a"},
                      CleanRow{"../../a", "a"}, CleanRow{"a/..", ""}, CleanRow{"a/../b", "b"},
                      CleanRow{"a/b/..", "a/"}, CleanRow{"a/b/../c", "a/c"}, CleanRow{"a/b/../../c", "c"},
                      CleanRow{"a/b/../../../c", "c"}, CleanRow{"x/../../../etc/passwd", "etc/passwd"},
                      CleanRow{"/etc/passwd", "etc/passwd"}, CleanRow{"..\\..\\etc\\passwd", "etc/passwd"},
                      CleanRow{"a/./b", "a/b"}, CleanRow{"a/.", "a/"}, CleanRow{"a/.//b", "a//b"},
                      CleanRow{"a/...", "a/..."}, CleanRow{"a/..b/c", "a/..b/c"}, CleanRow{"C:\\x", "C:/x"},
                      // The rows told after the table.
                      CleanRow{"a/.//../b", "a/b"}, CleanRow{"..a/.a/...", "..a/.a/..."},
                      CleanRow{"a\\..\\..\\b/./../c", "c"}, CleanRow{"//..//..//", ""}));

TEST(CleanRelPath, RefusesNullArguments)
{
    char buf[4];
    EXPECT_EQ(dpx_cleanup_rel_path(nullptr, buf), DPX_E_INVALID_PARAM);
    EXPECT_EQ(dpx_cleanup_rel_path("a", nullptr), DPX_E_INVALID_PARAM);
}

TEST(CleanRelPath, NeverClimbsNeverStartsWithASeparatorNeverGrows)
{
    // Every path of up to 6 characters over a small alphabet.
    const char alphabet[] = {'a', '.', '/', '\\'};
    std::string in;
    std::vector<std::string> frontier{""};
    for (int len = 1; len <= 6; ++len) {
        std::vector<std::string> next;
        for (const auto &prefix : frontier) {
            for (char c : alphabet) {
                std::string s = prefix + c;
                next.push_back(s);
                std::vector<char> out(s.size() + 1);
                ASSERT_EQ(dpx_cleanup_rel_path(s.c_str(), out.data()), DPX_OK);
                std::string clean = out.data();
                ASSERT_LE(clean.size(), s.size()) << s;
                ASSERT_TRUE(clean.empty() || clean[0] != '/') << s << " -> " << clean;
                ASSERT_EQ(clean.find('\\'), std::string::npos) << s;
                std::string framed = "/" + clean + "/";
                ASSERT_EQ(framed.find("/../"), std::string::npos) << s << " -> " << clean;
            }
        }
        frontier = std::move(next);
    }
}

// Each case below runs in a child: the root and product are cached for the
// life of a process.
TEST(DepotRoot, ComesFromDpxDepotroot)
{
    EXPECT_EQ(in_child([] {
                  setenv("DPX_DEPOTROOT", "/d", 1);
                  unsetenv("VESPERHOME");
                  const char *root = dpx_get_depotroot();
                  return root != nullptr && std::strcmp(root, "/d") == 0 ? "" : "wrong root";
              }),
              "");
}

TEST(DepotRoot, FallsBackToVesperhomeWithDpxdepot)
{
    EXPECT_EQ(in_child([] {
                  unsetenv("DPX_DEPOTROOT");
                  setenv("VESPERHOME", "/h", 1);
                  const char *root = dpx_get_depotroot();
                  return root != nullptr && std::strcmp(root, "/h/dpxdepot") == 0 ? "" : "wrong root";
              }),
              "");
}

TEST(DepotRoot, PrefersDpxDepotrootOverVesperhome)
{
    EXPECT_EQ(in_child([] {
                  setenv("DPX_DEPOTROOT", "/d", 1);
                  setenv("VESPERHOME", "/h", 1);
                  return std::strcmp(dpx_get_depotroot(), "/d") == 0 ? "" : "wrong root";
              }),
              "");
}

TEST(DepotRoot, IsNullWhileUnsetAndFoundOnceSetThenKept)
{
    EXPECT_EQ(in_child([]() -> std::string {
                  unsetenv("DPX_DEPOTROOT");
                  unsetenv("VESPERHOME");
                  if (dpx_get_depotroot() != nullptr)
                      return "root while unset";
                  setenv("DPX_DEPOTROOT", "/first", 1);
                  const char *first = dpx_get_depotroot();
                  if (first == nullptr || std::strcmp(first, "/first") != 0)
                      return "not found after set";
                  setenv("DPX_DEPOTROOT", "/second", 1);
                  const char *again = dpx_get_depotroot();
                  if (again != first || std::strcmp(again, "/first") != 0)
                      return "cache not kept";
                  return "";
              }),
              "");
}

TEST(DepotRoot, AcceptsTheEmptyStringAndKeepsATrailingSeparator)
{
    EXPECT_EQ(in_child([]() -> std::string {
                  setenv("DPX_DEPOTROOT", "", 1);
                  AFW_SetProductName("p");
                  char full[64];
                  if (dpx_get_full_path("x", full, sizeof full) != DPX_OK || std::strcmp(full, "/p/x") != 0)
                      return std::string("empty root gave ") + full;
                  return "";
              }),
              "");
    EXPECT_EQ(in_child([]() -> std::string {
                  setenv("DPX_DEPOTROOT", "/d/", 1);
                  AFW_SetProductName("p");
                  char full[64];
                  if (dpx_get_full_path("x", full, sizeof full) != DPX_OK || std::strcmp(full, "/d//p/x") != 0)
                      return std::string("trailing separator gave ") + full;
                  return "";
              }),
              "");
}

TEST(Product, ComesFromTheFrameworkAndIsRetriedWhileMissing)
{
    EXPECT_EQ(in_child([]() -> std::string {
                  unsetenv("AFW_PRODUCT");
                  if (dpx_get_product() != nullptr)
                      return "product while unknown";
                  AFW_SetProductName("abc");
                  const char *p = dpx_get_product();
                  if (p == nullptr || std::strcmp(p, "abc") != 0)
                      return "product not found";
                  AFW_SetProductName("other");
                  return std::strcmp(dpx_get_product(), "abc") == 0 ? "" : "product not cached";
              }),
              "");
}

TEST(DepotCaches, ManyThreadsAtTheFirstUseAllSeeOneWholeText)
{
    EXPECT_EQ(in_child([]() -> std::string {
                  std::string root(3000, 'r');
                  root[0] = '/';
                  setenv("DPX_DEPOTROOT", root.c_str(), 1);
                  AFW_SetProductName("prod");
                  std::vector<const char *> roots(16), products(16);
                  std::vector<std::thread> threads;
                  for (int i = 0; i < 16; ++i)
                      threads.emplace_back([&, i] {
                          roots[static_cast<size_t>(i)] = dpx_get_depotroot();
                          products[static_cast<size_t>(i)] = dpx_get_product();
                      });
                  for (auto &t : threads)
                      t.join();
                  for (int i = 0; i < 16; ++i) {
                      if (roots[static_cast<size_t>(i)] == nullptr || root != roots[static_cast<size_t>(i)])
                          return "thread saw a wrong root";
                      if (products[static_cast<size_t>(i)] == nullptr ||
                          std::strcmp(products[static_cast<size_t>(i)], "prod") != 0)
                          return "thread saw a wrong product";
                  }
                  // After the race one copy stays for good.
                  return dpx_get_depotroot() == dpx_get_depotroot() ? "" : "cache unstable";
              }),
              "");
}

// Full paths with root /d and product p.
class FullPath : public ::testing::Test {
protected:
    static std::string run(const std::function<std::string()> &body)
    {
        return in_child([&] {
            setenv("DPX_DEPOTROOT", "/d", 1);
            AFW_SetProductName("p");
            return body();
        });
    }
};

TEST_F(FullPath, CleansTheRelativePathBelowTheProduct)
{
    EXPECT_EQ(run([]() -> std::string {
                  char full[4096];
                  if (dpx_get_full_path("../../etc/passwd", full, sizeof full) != DPX_OK)
                      return "failed";
                  if (std::strcmp(full, "/d/p/etc/passwd") != 0)
                      return full;
                  if (dpx_get_full_path("conf\\a.cfg", full, sizeof full) != DPX_OK ||
                      std::strcmp(full, "/d/p/conf/a.cfg") != 0)
                      return full;
                  if (dpx_get_full_path("", full, sizeof full) != DPX_OK || std::strcmp(full, "/d/p/") != 0)
                      return full;
                  return "";
              }),
              "");
}

TEST_F(FullPath, Fits4095CharactersAndRefuses4096)
{
    EXPECT_EQ(run([]() -> std::string {
                  char full[4096];
                  // "/d/p/" is 5 characters.
                  std::string fits(4095 - 5, 'f');
                  if (dpx_get_full_path(fits.c_str(), full, sizeof full) != DPX_OK || std::strlen(full) != 4095)
                      return "4095 characters refused";
                  std::string too_long(4096 - 5, 'f');
                  if (dpx_get_full_path(too_long.c_str(), full, sizeof full) != DPX_E_PATH_TOO_LONG)
                      return "4096 characters accepted";
                  std::string longer(10000, 'g');
                  if (dpx_get_full_path(longer.c_str(), full, sizeof full) != DPX_E_PATH_TOO_LONG)
                      return "10000 characters accepted";
                  return "";
              }),
              "");
}

TEST_F(FullPath, TestsTheDepotBeforeTheArguments)
{
    EXPECT_EQ(in_child([]() -> std::string {
                  unsetenv("DPX_DEPOTROOT");
                  unsetenv("VESPERHOME");
                  char full[16];
                  if (dpx_get_full_path(nullptr, full, sizeof full) != DPX_E_NO_DEPOT)
                      return "no depot not first";
                  setenv("DPX_DEPOTROOT", "/d", 1);
                  unsetenv("AFW_PRODUCT");
                  if (dpx_get_full_path("a", full, sizeof full) != DPX_E_NO_DEPOT)
                      return "missing product accepted";
                  AFW_SetProductName("p");
                  if (dpx_get_full_path(nullptr, full, sizeof full) != DPX_E_INVALID_PARAM ||
                      dpx_get_full_path("a", nullptr, 16) != DPX_E_INVALID_PARAM)
                      return "null accepted";
                  return "";
              }),
              "");
}

TEST_F(FullPath, RefusesAFieldWithoutNulAndNeverReadsPastIt)
{
    EXPECT_EQ(run([]() -> std::string {
                  // The field is the whole allocation: ASan would catch a read past it.
                  std::vector<char> field(DPX_PATH_LEN, 'a');
                  char full[DPX_PATH_LEN];
                  if (dpx_get_full_path_of_field(field.data(), field.size(), full, sizeof full) !=
                      DPX_E_INVALID_PARAM)
                      return "unterminated field accepted";
                  field[10] = '\0';
                  if (dpx_get_full_path_of_field(field.data(), field.size(), full, sizeof full) != DPX_OK ||
                      std::strcmp(full, "/d/p/aaaaaaaaaa") != 0)
                      return "terminated field refused";
                  return "";
              }),
              "");
}

}  // namespace
