// Helpers of the file-layer and transfer suites: a cx_status that reads well
// in an assertion, and a cx_ file that closes itself.
#ifndef DPX_TESTS_CX_TEST_FILE_H
#define DPX_TESTS_CX_TEST_FILE_H

#include "dpx/dpx.h"

#include <gtest/gtest.h>

#include <string>
#include <utility>

namespace dpxtest {

// Passes when `status` has exactly this category and code.
inline testing::AssertionResult cx_is(cx_status status, char category, int32_t code)
{
    if (status.category == category && status.code == code)
        return testing::AssertionSuccess();
    return testing::AssertionFailure() << "cx_status " << status.category << status.code << ", expected " << category
                                       << code;
}

inline testing::AssertionResult cx_ok(cx_status status) { return cx_is(status, CX_CATEGORY_OK, 0); }

// A cx_os_file_t, opened through cx_open_file or wrapping a stream that the
// test opened itself, and closed at the end of the scope.
struct CxFile {
    explicit CxFile(FILE *stream = nullptr) : file{stream} {}
    ~CxFile() { close(); }
    CxFile(const CxFile &) = delete;
    CxFile &operator=(const CxFile &) = delete;
    cx_status open(const std::string &path, int32_t mode)
    {
        close();
        return cx_open_file(path.c_str(), &file, mode);
    }
    cx_status close()
    {
        cx_os_file_t open{std::exchange(file.stream, nullptr)};
        return open.stream != nullptr ? cx_close_file(&open) : cx_status{CX_CATEGORY_OK, 0};
    }
    cx_os_file_t *get() { return &file; }

    cx_os_file_t file;
};

}  // namespace dpxtest

#endif
