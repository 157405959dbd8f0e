// The depot of the service suites. The library caches its depot root and
// product name on first use, so each test process gets one depot, set up
// before any test runs: <tmp>/depot with the product "prod", and two files
// that no request may reach, <tmp>/depot/secret and <tmp>/outside. Each test
// keeps to its own subdirectory of the product's directory.
#ifndef DPX_TESTS_SERVICE_DEPOT_H
#define DPX_TESTS_SERVICE_DEPOT_H

#include "test_support.h"

#include "afw/afw.h"
#include "dpx/dpx.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdlib>
#include <filesystem>
#include <map>
#include <memory>
#include <string>
#include <vector>

namespace dpxtest {

inline std::unique_ptr<TempDir> &depot_tmp()
{
    static std::unique_ptr<TempDir> tmp;
    return tmp;
}

inline std::string depot_root()
{
    return *depot_tmp() / "depot";
}

inline std::string product_dir()
{
    return depot_root() + "/prod";
}

// Set when a test of the depot has run in this process: from then on the
// depot is cached, and no child of this process sees it unknown.
inline bool &depot_cached()
{
    static bool cached = false;
    return cached;
}

class ServiceDepot : public ::testing::Environment {
public:
    void SetUp() override
    {
        depot_tmp() = std::make_unique<TempDir>();
        std::filesystem::create_directories(product_dir());
        write_file(depot_root() + "/secret", "depot secret");
        write_file(*depot_tmp() / "outside", "outside the depot");
        setenv("DPX_DEPOTROOT", depot_root().c_str(), 1);
        AFW_SetProductName("prod");
    }
    void TearDown() override { depot_tmp().reset(); }
};

inline ::testing::Environment *const kServiceDepot = ::testing::AddGlobalTestEnvironment(new ServiceDepot);

// Tests that use the depot. Each starts with its own subdirectory empty.
class DepotTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        depot_cached() = true;
        std::filesystem::remove_all(full(rel("")));
    }

    // `name` in this test's own subdirectory, relative to the product's directory.
    static std::string rel(const std::string &name)
    {
        const auto *info = ::testing::UnitTest::GetInstance()->current_test_info();
        std::string dir = std::string(info->test_suite_name()) + "." + info->name();
        std::replace(dir.begin(), dir.end(), '/', '_');
        return dir + "/" + name;
    }
    static std::string full(const std::string &rel_path) { return product_dir() + "/" + rel_path; }
    // Writes a file at `rel_path` in the product's directory, making its directories.
    static void plant(const std::string &rel_path, const std::string &bytes)
    {
        std::filesystem::create_directories(std::filesystem::path(full(rel_path)).parent_path());
        write_file(full(rel_path), bytes);
    }
};

// A request's file record as the client fills it: the path NUL-filled, the
// rest cleared.
inline dpx_file_desc desc_for(const std::string &path)
{
    dpx_file_desc desc{};
    path.copy(desc.path, sizeof desc.path - 1);
    return desc;
}

// Paths that try to leave the product's directory. `lands` is the cleaned
// path, where a call that succeeds reads or writes inside the product's
// directory; `terminated` false fills the whole path field with no NUL.
struct HostilePath {
    std::string path;
    std::string lands;
    dpx_status read;
    dpx_status write;
    bool terminated = true;
};

inline std::vector<HostilePath> hostile_paths()
{
    std::string climb;
    while (climb.size() + 3 + 6 <= 4095)
        climb += "../";
    const std::string planted_secret = depot_root() + "/secret";
    const std::string planted_outside = *depot_tmp() / "outside";
    return {
        {"../secret", "secret", DPX_OK, DPX_OK},
        {"../../outside", "outside", DPX_OK, DPX_OK},
        {"./../secret", "secret", DPX_OK, DPX_OK},
        {"x/../../secret", "secret", DPX_OK, DPX_OK},
        {"a/b/../../../../secret", "secret", DPX_OK, DPX_OK},
        {"secret/../../outside", "outside", DPX_OK, DPX_OK},
        {"..\\..\\outside", "outside", DPX_OK, DPX_OK},
        {"a\\b\\..\\..\\..\\secret", "secret", DPX_OK, DPX_OK},
        {"\\\\..\\secret", "secret", DPX_OK, DPX_OK},
        {"/secret", "secret", DPX_OK, DPX_OK},
        {"C:\\..\\secret", "secret", DPX_OK, DPX_OK},
        {"C:\\..\\..\\outside", "outside", DPX_OK, DPX_OK},
        // The absolute paths of the planted files become paths below the
        // product, where nothing is to be read but a write may land.
        {planted_secret, planted_secret.substr(1), DPX_E_FILE_READ, DPX_OK},
        {planted_outside, planted_outside.substr(1), DPX_E_FILE_READ, DPX_OK},
        // Nothing left but the product's directory itself, or a file as a directory.
        {"..", "", DPX_E_FILE_READ, DPX_E_FILE_WRITE},
        {"x/..", "", DPX_E_FILE_READ, DPX_E_FILE_WRITE},
        {"../secret/.", "secret/", DPX_E_FILE_READ, DPX_E_FILE_WRITE},
        // Long ones: 4095 characters that clean short, 4095 that don't, a
        // field of 4096 with no NUL, and more than a name or an open can take.
        {climb + "secret", "secret", DPX_OK, DPX_OK},
        {std::string(4095, 'a'), "", DPX_E_PATH_TOO_LONG, DPX_E_PATH_TOO_LONG},
        {std::string(16, '.') + "...", "", DPX_E_INVALID_PARAM, DPX_E_INVALID_PARAM, false},
        {"../" + std::string(300, 'b'), std::string(300, 'b'), DPX_E_FILE_READ, DPX_E_FILE_WRITE},
    };
}

inline dpx_file_desc desc_for(const HostilePath &row)
{
    dpx_file_desc desc = desc_for(row.path);
    if (!row.terminated)
        std::fill(std::begin(desc.path), std::end(desc.path), '.');
    return desc;
}

// Every file of the temporary tree outside the product's directory, with its
// content.
inline std::map<std::string, std::string> files_outside_product()
{
    namespace fs = std::filesystem;
    std::map<std::string, std::string> files;
    for (auto it = fs::recursive_directory_iterator(depot_tmp()->path()); it != fs::end(it); ++it) {
        if (it->path() == product_dir())
            it.disable_recursion_pending();
        else if (it->is_regular_file())
            files[it->path()] = read_file(it->path());
    }
    return files;
}

}  // namespace dpxtest

#endif
