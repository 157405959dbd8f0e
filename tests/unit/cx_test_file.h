// Helpers of the file-layer and transfer suites: a cx_ file that closes
// itself, and a cx_status that reads well in an assertion.
#ifndef DPX_TESTS_CX_TEST_FILE_H
#define DPX_TESTS_CX_TEST_FILE_H

#include "dpx/dpx.h"

#include <gtest/gtest.h>

#include <string>

namespace dpxtest {

// Passes when `status` has exactly this category and code.
inline testing::AssertionResult cx_is(cx_status status, char category, int32_t code)
{
    if (status.category == category && status.code == code)
        return testing::AssertionSuccess();
    return testing::AssertionFailure() << "cx_status " << status.category << status.code << ", expected " << category
                                       << code;
}

inline testing::AssertionResult cx_ok(cx_status status)
{
    return cx_is(status, CX_CATEGORY_OK, 0);
}

// A cx_os_file_t opened through cx_open_file and closed at the end of the
// scope, or wrapping a stream that the test opened itself.
class CxFile {
public:
    CxFile() = default;
    explicit CxFile(FILE *stream) : file_{stream}, open_(stream != nullptr) {}
    ~CxFile() { close(); }
    CxFile(const CxFile &) = delete;
    CxFile &operator=(const CxFile &) = delete;

    cx_status open(const std::string &path, int32_t mode)
    {
        close();
        cx_status status = cx_open_file(path.c_str(), &file_, mode);
        open_ = status.category == CX_CATEGORY_OK;
        return status;
    }
    cx_status close()
    {
        cx_status status = {CX_CATEGORY_OK, 0};
        if (open_)
            status = cx_close_file(&file_);
        open_ = false;
        return status;
    }
    cx_os_file_t *get() { return &file_; }

private:
    cx_os_file_t file_{};
    bool open_ = false;
};

}  // namespace dpxtest

#endif
