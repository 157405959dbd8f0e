// DPX::String: storage, bounds, searching, editing, number conversion.
#include "dpx/text.h"

#include "test_support.h"
#include "trc/trc1.h"

#include <gtest/gtest.h>

#include <cstdio>
#include <functional>
#include <string>
#include <vector>

using DPX::IndexOutOfBoundsException;
using DPX::String;
using DPX::UChar;

namespace {

// A string built from units as they stand, 0 units included.
String text(std::u16string_view s)
{
    std::vector<UChar> v(s.begin(), s.end());
    String r;
    r.assign(v.data(), static_cast<uint32_t>(v.size()));
    return r;
}

std::u16string u16(const String &s)
{
    return std::u16string(s.getData(), s.getData() + s.length());
}

// Sees the array behind a string.
struct Probe : String {
    using String::String;
    uint32_t capacity() const { return units.getCapacity(); }
    uint32_t array_size() const { return units.getSize(); }
};

}  // namespace

TEST(StringStorage, TheEmptyStringHoldsOnlyItsTerminator)
{
    Probe empty;
    EXPECT_EQ(empty.length(), 0u);
    EXPECT_EQ(empty.getData()[0], 0);
    EXPECT_EQ(empty.array_size(), 1u);
    EXPECT_EQ(empty.capacity(), 8u);
    EXPECT_EQ(String(static_cast<const char *>(nullptr)).length(), 0u);
    EXPECT_EQ(String(static_cast<const UChar *>(nullptr)).length(), 0u);
    EXPECT_EQ(String::createUnicodeString(nullptr), nullptr);
    EXPECT_STREQ(String().c_str(), "");
}

TEST(StringStorage, AssignmentReservesTextAndTerminatorAndACopyKeepsTheCapacity)
{
    Probe hundred(std::string(100, 'q').c_str());
    EXPECT_EQ(hundred.length(), 100u);
    EXPECT_EQ(hundred.capacity(), 101u);
    Probe copy(hundred);
    hundred.clear();
    EXPECT_EQ(hundred.capacity(), 8u);
    hundred.assign("abc");
    EXPECT_EQ(hundred.capacity(), 8u);
    EXPECT_EQ(copy.capacity(), 101u);
}

TEST(StringStorage, CountedSourcesStopAtTheirCountOrTheirEnd)
{
    EXPECT_EQ(u16(String("abc", 2)), u"ab");
    EXPECT_EQ(u16(String("ab", 5)), u"ab");
    EXPECT_EQ(u16(String(String("abc"), 2)), u"ab");
    EXPECT_EQ(u16(String(String("abc"), 9)), u"abc");
    String with_zero = text(std::u16string(u"a\0b", 3));
    EXPECT_EQ(with_zero.length(), 3u);
    EXPECT_EQ(String::compare(with_zero, text(u"a")), 0);  // compare stops at the 0 unit
    UChar *copy = String::copyUnicodeString(String("xyz").getData());
    EXPECT_EQ(std::u16string(copy, copy + 4), std::u16string(u"xyz\0", 4));
    String::releaseUnicodeString(copy);
}

TEST(StringStorage, SelfAssignmentChangesNothing)
{
    String s("abc");
    const String &self = s;
    s = self;
    EXPECT_EQ(u16(s), u"abc");
    s.assign(self, 2);
    EXPECT_EQ(u16(s), u"ab");
    DPX::CharStar chars = s.c_str();
    const DPX::CharStar &same = chars;
    chars = same;
    EXPECT_STREQ(chars, "ab");
}

TEST(StringCompare, GivesTheUnitDifferenceOrThePrefixOrder)
{
    struct Row {
        std::u16string_view a, b;
        int expected;
    };
    const Row rows[] = {{u"a", u"ab", -1}, {u"ab", u"a", 1}, {u"a", u"c", -2}, {u"", u"", 0}, {u"abc", u"abc", 0}};
    for (const Row &row : rows)
        EXPECT_EQ(String::compare(text(row.a), text(row.b)), row.expected);
    EXPECT_TRUE(String("ab") == "ab");
    EXPECT_TRUE("ab" == String("ab"));
    EXPECT_TRUE(String("ab") != String("abc"));
    EXPECT_EQ(u16(String("ab") + String("cd")), u"abcd");
}

TEST(StringBounds, EveryOperationThrowsExactlyAtItsBoundAndLeavesTheText)
{
    struct Row {
        const char *what;
        std::u16string_view start;
        std::function<void(String &)> op;
        bool throws;
    };
    const String xy("xy");
    const Row rows[] = {
        {"[length] is the terminator", u"abc", [](String &s) { EXPECT_EQ(s[3], 0); }, false},
        {"[length + 1]", u"abc", [](String &s) { s[4]; }, true},
        {"const [length + 1]", u"abc", [](String &s) { static_cast<const String &>(s)[4]; }, true},
        {"append(s, length of s)", u"abc", [&](String &s) { s.append(xy, 2); }, false},
        {"append(s, above its length)", u"abc", [&](String &s) { s.append(xy, 3); }, true},
        {"erase(0, 0)", u"abc", [](String &s) { s.erase(0, 0); }, true},
        {"erase to the end", u"abc", [](String &s) { s.erase(1, 2); }, false},
        {"erase past the end", u"abc", [](String &s) { s.erase(2, 2); }, true},
        {"erase(pos) at length", u"abc", [](String &s) { s.erase(3); }, true},
        {"erase(pos) below length", u"abc", [](String &s) { s.erase(2); }, false},
        {"substr(0, 0)", u"abc", [](String &s) { s.substr(0, 0); }, true},
        {"substr to the end", u"abc", [](String &s) { s.substr(1, 2); }, false},
        {"substr wrapping", u"abc", [](String &s) { s.substr(UINT32_MAX, 2); }, true},
        {"substr(pos) at length", u"abc", [](String &s) { s.substr(3); }, true},
        {"substr(0) of empty", u"", [](String &s) { s.substr(0); }, true},
        {"find unit at length", u"abc", [](String &s) { s.find(UChar{'a'}, 3); }, true},
        {"find unit in empty", u"", [](String &s) { s.find(UChar{'a'}, 0); }, true},
        {"find char at length", u"abc", [](String &s) { s.find('a', 3); }, true},
        {"find escaped at length", u"abc", [](String &s) { s.find(UChar{'a'}, UChar{'\\'}, 3); }, true},
        {"find string at length", u"abc", [](String &s) { EXPECT_EQ(s.find(String("c"), 3), String::NPOS); }, false},
        {"find empty string", u"abc", [](String &s) { EXPECT_EQ(s.find(String(), 0), String::NPOS); }, false},
        {"rfind in empty", u"", [](String &s) { EXPECT_EQ(s.rfind(UChar{'a'}), String::NPOS); }, false},
    };
    for (const Row &row : rows) {
        String s = text(row.start);
        if (row.throws) {
            EXPECT_THROW(row.op(s), IndexOutOfBoundsException) << row.what;
            EXPECT_EQ(u16(s), row.start) << row.what;
        } else {
            EXPECT_NO_THROW(row.op(s)) << row.what;
        }
    }
}

TEST(StringBounds, AThrowSiteTracesAndNamesItsLineInThisLibrary)
{
    dpxtest::TraceCapture trace(TRC1_ERROR);
    String s("abc");
    try {
        s.erase(0, 0);
        FAIL() << "no exception";
    } catch (const IndexOutOfBoundsException &e) {
        int line = 0;
        ASSERT_EQ(std::sscanf(e.message, "line: %d, file: ", &line), 1);
        EXPECT_NE(std::string(e.message).find("dpxstr.cc"), std::string::npos);
        EXPECT_TRUE(trace.contains("dpxstr erase:" + std::to_string(line) +
                                   " IndexOutOfBounds occurred, throwing exception"))
            << trace.text();
    }
}

TEST(StringFind, FindsUnitsCharactersAndStrings)
{
    String s = text(u"abcab\xFF80");
    EXPECT_EQ(s.find(UChar{'b'}, 0), 1u);
    EXPECT_EQ(s.find(UChar{'b'}, 2), 4u);
    EXPECT_EQ(s.find(UChar{'z'}, 0), String::NPOS);
    EXPECT_EQ(s.find('\x80', 0), 5u);  // widened with its sign
    EXPECT_EQ(s.find(String("ca"), 0), 2u);
    EXPECT_EQ(s.find(String("ab"), 1), 3u);
    EXPECT_EQ(s.find(String("ab"), 4), String::NPOS);
    EXPECT_EQ(s.find(String("abcab!!"), 0), String::NPOS);
    EXPECT_EQ(s.rfind(UChar{'a'}), 3u);
    EXPECT_EQ(s.rfind(0), 6u);
    EXPECT_EQ(String().rfind(0), 0u);
}

TEST(StringFind, AnEscapedUnitIsSkippedAndEscapesEscapeEachOther)
{
    struct Row {
        std::u16string_view text;
        uint32_t pos;
        uint32_t expected;
    };
    const Row rows[] = {
        {u"\\\"", 0, String::NPOS},     {u"\\\\\"", 0, 2},  {u"\\\\\\\"", 0, String::NPOS},
        {u"a\"", 0, 1},                 {u"\"", 0, 0},      {u"\\\"x\"", 0, 3},
        {u"\\\\\\\\\"", 0, 4},          {u"\"a\"", 1, 2},
    };
    for (const Row &row : rows)
        EXPECT_EQ(text(row.text).find(UChar{'"'}, UChar{'\\'}, row.pos), row.expected)
            << std::string(row.text.begin(), row.text.end());
}

TEST(StringEdit, AppendEraseAndSubstrWorkOnUnits)
{
    String s("ab");
    s.append(s);
    EXPECT_EQ(u16(s), u"abab");
    s.append(UChar{0x263A});
    EXPECT_EQ(u16(s), u"abab\x263A");
    EXPECT_EQ(s.getData()[s.length()], 0);
    EXPECT_EQ(u16(s.substr(1, 2)), u"ba");
    EXPECT_EQ(u16(s.substr(3)), u"b\x263A");
    EXPECT_EQ(u16(s.erase(1, 2)), u"ab\x263A");
    EXPECT_EQ(u16(s.erase(1)), u"a");
}

TEST(StringEdit, TrimRemovesOuterWhiteSpaceOnly)
{
    Probe s("  a b  ");
    s.trim();
    EXPECT_EQ(u16(s), u"a b");
    Probe blanks(std::string(30, ' ').c_str());
    blanks.trim();
    EXPECT_EQ(blanks.length(), 0u);
    EXPECT_EQ(blanks.capacity(), 8u);
    EXPECT_EQ(u16(String("\t x").trim()), u"x");
    EXPECT_EQ(u16(String("x \n").trim()), u"x");
    EXPECT_EQ(u16(String().trim()), u"");
}

TEST(StringEdit, RemoveEscapesDropsTheLastEscapeOfEachRun)
{
    const std::pair<const char *, std::u16string_view> rows[] = {
        {"axb", u"ab"}, {"axxb", u"axb"}, {"axxxb", u"axxb"}, {"ax", u"a"}, {"x", u""}, {"xx", u"x"}, {"xaxb", u"ab"},
    };
    for (const auto &[input, expected] : rows)
        EXPECT_EQ(u16(String(input).removeEscapes(UChar{'x'})), expected) << input;
}

TEST(StringEdit, InsertEscapesMarksEveryMemberOfTheSet)
{
    EXPECT_EQ(u16(String("cab").insertEscapes(UChar{'x'}, String("ab"))), u"cxaxb");
    EXPECT_EQ(u16(String("axb").insertEscapes(UChar{'x'}, String("ab"))), u"xaxxb");
    EXPECT_EQ(u16(String("axb").insertEscapes(UChar{'x'}, String("x"))), u"axxb");
    // A 0 unit in the set matches the terminator too.
    EXPECT_EQ(u16(String("ab").insertEscapes(UChar{'x'}, text(std::u16string(u"\0", 1)))), u"abx");
    String self("ab");
    EXPECT_EQ(u16(self.insertEscapes(UChar{'x'}, self)), u"xaxb");
}

TEST(StringReplace, ReplacesEveryOccurrenceFromTheLeftAndTracesItsWork)
{
    dpxtest::TraceCapture trace(TRC1_FLOW);
    struct Row {
        const char *s, *from, *to, *expected;
    };
    const Row rows[] = {
        {"aXa", "a", "bb", "bbXbb"}, {"aaa", "aa", "b", "ba"}, {"", "x", "y", ""},
        {"abc", "", "z", "abc"},     {"abab", "ab", "", ""},   {"xyz", "q", "r", "xyz"},
    };
    for (const Row &row : rows)
        EXPECT_TRUE(String::replace(String(row.s), String(row.from), String(row.to)) == row.expected) << row.s;
    EXPECT_TRUE(trace.contains("Str [aXa], replace [a] with [bb]")) << trace.text();
    EXPECT_TRUE(trace.contains("Returning [bbXbb]"));
}

TEST(StringConvertToInt, AcceptsAWholeDecimalNumberBetweenTheLongLimits)
{
    dpxtest::TraceCapture trace(TRC1_ERROR);
    struct Row {
        const char *text;
        bool accepted;
        int32_t value;
    };
    const Row rows[] = {
        {"42", true, 42},
        {" -7", true, -7},
        {"", true, 0},
        {"   ", false, 0},
        {"12 ", false, 0},
        {"12a", false, 0},
        {"2147483646", true, 2147483646},
        {"2147483647", false, 0},
        {"-2147483647", true, -2147483647},
        {"-2147483648", false, 0},
        {"12345678901", false, 0},
        {"-99999999999", false, 0},
    };
    for (const Row &row : rows) {
        int32_t out = 99;
        EXPECT_EQ(String::convertToInt(String(row.text), &out), row.accepted) << row.text;
        EXPECT_EQ(out, row.value) << row.text;
    }
    EXPECT_TRUE(trace.contains("Can't convert, number is too large: 12345678901"));
    EXPECT_TRUE(trace.contains("Can't convert, buffer is not number: 12a"));
}
