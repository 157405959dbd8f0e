// DPX::UCharArray: exact growth, bounds, and the exception at its bounds.
#include "dpx/text.h"

#include "test_support.h"
#include "trc/trc1.h"

#include <gtest/gtest.h>

#include <cstdio>
#include <functional>
#include <string>
#include <vector>

using DPX::IndexOutOfBoundsException;
using DPX::UChar;
using DPX::UCharArray;

namespace {

UCharArray array_of(std::u16string_view text)
{
    UCharArray array;
    for (char16_t c : text)
        array.append(static_cast<UChar>(c));
    return array;
}

std::u16string content(const UCharArray &array)
{
    return std::u16string(array.getData(), array.getData() + array.getSize());
}

// The line of a throw site, read from the exception's text.
int thrown_line(const std::function<void()> &operation)
{
    try {
        operation();
    } catch (const IndexOutOfBoundsException &e) {
        int line = 0;
        EXPECT_EQ(std::sscanf(e.message, "line: %d, file: ", &line), 1) << e.message;
        EXPECT_NE(std::string(e.message).find("dpxarray.cc"), std::string::npos) << e.message;
        return line;
    }
    ADD_FAILURE() << "no IndexOutOfBoundsException";
    return 0;
}

}  // namespace

TEST(UCharArrayGrowth, NewAndSizedArraysHaveTheirFixedCapacities)
{
    UCharArray empty;
    EXPECT_EQ(empty.getSize(), 0u);
    EXPECT_EQ(empty.getCapacity(), 8u);
    UCharArray five(5);
    EXPECT_EQ(five.getSize(), 5u);
    EXPECT_EQ(five.getCapacity(), 15u);
    UCharArray zero(0);
    EXPECT_EQ(zero.getSize(), 0u);
    EXPECT_EQ(zero.getCapacity(), 10u);
}

TEST(UCharArrayGrowth, AppendingPastTheCapacityGrowsByExactlyOneUnit)
{
    UCharArray array;
    std::vector<uint32_t> capacities;
    for (UChar c = 1; c <= 10; ++c) {
        array.append(c);
        capacities.push_back(array.getCapacity());
    }
    EXPECT_EQ(capacities, (std::vector<uint32_t>{8, 8, 8, 8, 8, 8, 8, 8, 9, 10}));
    EXPECT_EQ(content(array), u"\x01\x02\x03\x04\x05\x06\x07\x08\x09\x0A");
}

TEST(UCharArrayGrowth, ReserveNeverShrinksAndGrowStaysInPlaceWhileItFits)
{
    UCharArray array = array_of(u"abcdefg");
    array.reserveCapacity(8);
    array.reserveCapacity(3);  // below the size
    EXPECT_EQ(array.getCapacity(), 8u);
    const UChar *block = array.getData();
    array.grow(1);
    EXPECT_EQ(array.getSize(), 8u);
    EXPECT_EQ(array.getData(), block);
    array.reserveCapacity(1000);
    EXPECT_EQ(array.getCapacity(), 1000u);
    EXPECT_EQ(content(array).substr(0, 7), u"abcdefg");
    array.clear();
    EXPECT_EQ(array.getSize(), 0u);
    EXPECT_EQ(array.getCapacity(), 8u);
}

TEST(UCharArrayGrowth, ACopyTakesTheCapacityOfItsSource)
{
    UCharArray source = array_of(u"abc");
    source.reserveCapacity(40);
    UCharArray copy(source);
    EXPECT_EQ(copy.getCapacity(), 40u);
    EXPECT_EQ(content(copy), u"abc");
    UCharArray assigned;
    assigned = source;
    EXPECT_EQ(assigned.getCapacity(), 40u);
    EXPECT_NE(assigned.getData(), source.getData());

    const UChar *block = source.getData();
    UCharArray &self = source;
    source = self;
    EXPECT_EQ(source.getData(), block);
    EXPECT_EQ(content(source), u"abc");
}

TEST(UCharArrayBounds, IndexingIsCheckedAgainstTheSize)
{
    UCharArray array = array_of(u"xyz");
    const UCharArray &read_only = array;
    EXPECT_EQ(read_only[2], u'z');
    array[2] = u'w';
    EXPECT_EQ(read_only[2], u'w');
    EXPECT_THROW(array[3], IndexOutOfBoundsException);
    EXPECT_THROW(read_only[3], IndexOutOfBoundsException);
    UCharArray empty;
    for (uint32_t i : {0u, 1u, 7u, UINT32_MAX})
        EXPECT_THROW(empty[i], IndexOutOfBoundsException) << i;
}

TEST(UCharArrayBounds, InsertAndRemoveMoveTheTailAndRejectPositionsBeyondIt)
{
    UCharArray array = array_of(u"ad");
    const UChar bc[] = {u'b', u'c'};
    array.insert(1, bc, 2);
    array.insert(4, UChar{u'e'});  // at the size: as append
    array.prepend(UChar{u'_'});
    EXPECT_EQ(content(array), u"_abcde");
    EXPECT_THROW(array.insert(7, bc, 2), IndexOutOfBoundsException);
    EXPECT_EQ(content(array), u"_abcde");

    uint32_t capacity = array.getCapacity();
    const UChar *block = array.getData();
    array.remove(0);
    array.remove(1, 2);
    EXPECT_EQ(content(array), u"ade");
    EXPECT_EQ(array.getCapacity(), capacity);
    EXPECT_EQ(array.getData(), block);

    array.remove(3, 0);  // nothing, at the size
    EXPECT_THROW(array.remove(3), IndexOutOfBoundsException);
    EXPECT_THROW(array.remove(1, UINT32_MAX), IndexOutOfBoundsException);  // pos + n wraps
    EXPECT_EQ(content(array), u"ade");
}

TEST(IndexOutOfBoundsExceptionText, NamesLineAndFileAndAlwaysFits)
{
    EXPECT_STREQ(IndexOutOfBoundsException(176, "f").message, "line: 176, file: f");
    std::string path = "/" + std::string(2000, 'd') + "/dpxarray.cc";
    IndexOutOfBoundsException cut(176, path.c_str());
    EXPECT_EQ(std::string(cut.message).size(), 511u);
    EXPECT_EQ(std::string(cut.message).rfind("line: 176, file: /ddd", 0), 0u);
}

TEST(IndexOutOfBoundsExceptionText, EachThrowSiteTracesItsOwnLineBeforeThrowing)
{
    dpxtest::TraceCapture trace(TRC1_ERROR | TRC1_ENTRY);
    UCharArray array = array_of(u"ab");
    const UChar unit = u'x';
    struct Site {
        const char *operation;
        std::function<void()> fail;
    };
    const Site sites[] = {
        {"operator[]", [&] { array[2]; }},
        {"insert", [&] { array.insert(3, &unit, 1); }},
        {"remove", [&] { array.remove(2, 1); }},
    };
    for (const Site &site : sites) {
        int line = thrown_line(site.fail);
        std::string where = std::string(site.operation) + ":" + std::to_string(line);
        EXPECT_TRUE(trace.contains("dpxarray " + where + " ENTER")) << where;
        EXPECT_TRUE(trace.contains("IndexOutOfBounds in " + where)) << trace.text();
    }
    EXPECT_EQ(content(array), u"ab");
}
