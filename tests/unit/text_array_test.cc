// DPX::UCharArray: exact growth, bounds, and the exception at its bounds.
#include "dpx/text.h"

#include "test_support.h"
#include "trc/trc1.h"

#include <gtest/gtest.h>

#include <functional>
#include <string>
#include <tuple>
#include <vector>

using namespace DPX;

static UCharArray array_of(std::u16string_view text)
{
    UCharArray array;
    for (char16_t c : text)
        array.append(static_cast<UChar>(c));
    return array;
}

static std::u16string content(const UCharArray &array)
{
    return std::u16string(array.getData(), array.getData() + array.getSize());
}

TEST(UCharArray, GrowsExactlyToEachRequestAndNeverShrinksOrMovesWithoutNeed)
{
    EXPECT_EQ(UCharArray().getCapacity(), 8u);
    EXPECT_EQ(UCharArray(5).getCapacity(), 15u);
    EXPECT_EQ(UCharArray(0).getCapacity(), 10u);
    UCharArray array;
    std::vector<uint32_t> capacities;
    for (UChar c = 1; c <= 10; ++c) {
        array.append(c);
        capacities.push_back(array.getCapacity());
    }
    EXPECT_EQ(capacities, (std::vector<uint32_t>{8, 8, 8, 8, 8, 8, 8, 8, 9, 10}));
    array.clear();
    EXPECT_EQ(array.getCapacity(), 8u);

    UCharArray seven = array_of(u"abcdefg");
    seven.reserveCapacity(3);  // below the size
    const UChar *block = seven.getData();
    seven.grow(1);
    seven.remove(0, 2);
    EXPECT_EQ(seven.getCapacity(), 8u);
    EXPECT_EQ(seven.getData(), block);

    UCharArray source = array_of(u"abc"), assigned = array_of(u"x");
    source.reserveCapacity(40);
    source = static_cast<const UCharArray &>(source);
    assigned = source;
    UCharArray copy(assigned);
    EXPECT_EQ(copy.getCapacity(), 40u);
    EXPECT_EQ(content(copy), u"abc");
}

TEST(UCharArray, EditsMoveTheTailAndABoundFailureThrowsTracedAndLeavesTheArray)
{
    using Op = std::function<void(UCharArray &)>;
    const UChar bc[] = {u'b', u'c'};
    // What, start, edit, the content after it, and the function that throws (or null).
    const std::tuple<const char *, std::u16string_view, Op, std::u16string_view, const char *> rows[] = {
        {"write at size - 1", u"xyz", [](UCharArray &a) { a[2] = u'w'; }, u"xyw", nullptr},
        {"[size]", u"xyz", [](UCharArray &a) { a[3]; }, u"xyz", "operator[]"},
        {"const [size]", u"xyz", [](UCharArray &a) { static_cast<const UCharArray &>(a)[3]; }, u"xyz", "operator[]"},
        {"[0] of empty", u"", [](UCharArray &a) { a[0]; }, u"", "operator[]"},
        {"insert inside", u"ad", [&](UCharArray &a) { a.insert(1, bc, 2); }, u"abcd", nullptr},
        {"insert at size", u"ad", [](UCharArray &a) { a.insert(2, UChar{u'e'}); }, u"ade", nullptr},
        {"prepend", u"ad", [](UCharArray &a) { a.prepend(UChar{u'_'}); }, u"_ad", nullptr},
        {"insert at size + 1", u"ad", [&](UCharArray &a) { a.insert(3, bc, 2); }, u"ad", "insert"},
        {"remove inside", u"abcde", [](UCharArray &a) { a.remove(1, 2); }, u"ade", nullptr},
        {"remove nothing at size", u"ade", [](UCharArray &a) { a.remove(3, 0); }, u"ade", nullptr},
        {"remove at size", u"ade", [](UCharArray &a) { a.remove(3); }, u"ade", "remove"},
        {"remove wrapping", u"ade", [](UCharArray &a) { a.remove(1, UINT32_MAX); }, u"ade", "remove"},
    };
    for (const auto &[what, start, op, expected, site] : rows) {
        dpxtest::TraceCapture trace(TRC1_ERROR | TRC1_ENTRY);
        UCharArray array = array_of(start);
        if (site != nullptr)
            EXPECT_THROW(op(array), IndexOutOfBoundsException) << what;
        else
            op(array);
        EXPECT_EQ(trace.count(" ENTER"), site ? 1u : 0u) << what;
        EXPECT_EQ(trace.count("IndexOutOfBounds in " + std::string(site ? site : "") + ":"), site ? 1u : 0u) << what;
        EXPECT_EQ(content(array), expected) << what;
    }
}

TEST(UCharArray, TheExceptionNamesLineAndFileAndAlwaysFitsItsMessage)
{
    EXPECT_STREQ(IndexOutOfBoundsException(176, "f").message, "line: 176, file: f");
    std::string path = "/" + std::string(2000, 'd') + "/dpxarray.cc";
    std::string cut = IndexOutOfBoundsException(176, path.c_str()).message;
    EXPECT_EQ(cut.size(), 511u);
    EXPECT_EQ(cut.rfind("line: 176, file: /ddd", 0), 0u);
}
