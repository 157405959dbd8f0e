// DPX::String: storage, bounds, searching, editing, number conversion.
#include "dpx/text.h"

#include "test_support.h"
#include "trc/trc1.h"

#include <gtest/gtest.h>

#include <functional>
#include <string>
#include <tuple>
#include <utility>

using namespace DPX;

// A string of the units as they stand, 0 units included.
static String text(std::u16string_view s)
{
    String result;
    for (char16_t c : s)
        result.append(static_cast<UChar>(c));
    return result;
}

static std::u16string u16(const String &s)
{
    return std::u16string(s.getData(), s.getData() + s.length());
}

// Sees the array behind a string.
struct Probe : String {
    using String::String;
    uint32_t capacity() const { return units.getCapacity(); }
};

TEST(String, StorageHoldsTextAndTerminatorInExactlyTheCapacityRequested)
{
    Probe empty, hundred(std::string(100, 'q').c_str()), blanks(std::string(30, ' ').c_str());
    Probe copy(hundred);
    hundred.clear();
    blanks.trim();
    for (const Probe *eight : {&empty, &hundred, &blanks})
        EXPECT_EQ(std::pair(eight->length(), eight->capacity()), std::pair(0u, 8u));
    EXPECT_EQ(std::pair(copy.length(), copy.capacity()), std::pair(100u, 101u));
    EXPECT_STREQ(empty.c_str(), "");
    EXPECT_TRUE(String(static_cast<const char *>(nullptr)) == "" && String(static_cast<const UChar *>(nullptr)) == "");
    EXPECT_EQ(String::createUnicodeString(nullptr), nullptr);
    EXPECT_TRUE(String("abc", 2) == "ab" && String("ab", 5) == "ab");
    String s("abc");
    s = static_cast<const String &>(s);
    CharStar chars = s.c_str();
    chars = static_cast<const CharStar &>(chars);
    EXPECT_STREQ(chars, "abc");
}

TEST(String, CompareGivesTheUnitDifferenceOrThePrefixOrderUpToTheFirstZero)
{
    const std::tuple<std::u16string_view, std::u16string_view, int> rows[] = {
        {u"a", u"ab", -1}, {u"ab", u"a", 1}, {u"a", u"c", -2}, {u"", u"", 0},
        {std::u16string_view(u"a\0b", 3), u"a", 0}};
    for (const auto &[a, b, expected] : rows)
        EXPECT_EQ(String::compare(text(a), text(b)), expected);
}

TEST(String, EveryOperationChecksItsBoundAndAFailureTracesAndLeavesTheText)
{
    using Op = std::function<void(String &)>;
    // What, start, operation, the text after it, whether it throws.
    const std::tuple<const char *, std::u16string_view, Op, std::u16string_view, bool> rows[] = {
        {"[length] is the terminator", u"abc", [](String &s) { EXPECT_EQ(s[3], 0); }, u"abc", false},
        {"[length + 1]", u"abc", [](String &s) { s[4]; }, u"abc", true},
        {"const [length + 1]", u"abc", [](String &s) { static_cast<const String &>(s)[4]; }, u"abc", true},
        {"append itself", u"abc", [](String &s) { s.append(s); }, u"abcabc", false},
        {"escape the units of itself", u"ab", [](String &s) { s.insertEscapes(UChar{'x'}, s); }, u"xaxb", false},
        {"append(s, length of s)", u"abc", [](String &s) { s.append(String("xy"), 2); }, u"abcxy", false},
        {"append(s, above its length)", u"abc", [](String &s) { s.append(String("xy"), 3); }, u"abc", true},
        {"erase(0, 0)", u"abc", [](String &s) { s.erase(0, 0); }, u"abc", true},
        {"erase to the end", u"abc", [](String &s) { s.erase(1, 2); }, u"a", false},
        {"erase past the end", u"abc", [](String &s) { s.erase(2, 2); }, u"abc", true},
        {"erase(pos) at length", u"abc", [](String &s) { s.erase(3); }, u"abc", true},
        {"erase(pos) below length", u"abc", [](String &s) { s.erase(2); }, u"ab", false},
        {"substr(0, 0)", u"abc", [](String &s) { s.substr(0, 0); }, u"abc", true},
        {"substr to the end", u"abc", [](String &s) { s = s.substr(1, 2); }, u"bc", false},
        {"substr wrapping", u"abc", [](String &s) { s.substr(UINT32_MAX, 2); }, u"abc", true},
        {"substr(pos) at length", u"abc", [](String &s) { s.substr(3); }, u"abc", true},
        {"substr(pos)", u"abc", [](String &s) { s = s.substr(2); }, u"c", false},
        {"substr(0) of empty", u"", [](String &s) { s.substr(0); }, u"", true},
        {"find unit at length", u"abc", [](String &s) { s.find(UChar{'a'}, 3); }, u"abc", true},
        {"find unit in empty", u"", [](String &s) { s.find(UChar{'a'}, 0); }, u"", true},
        {"find char at length", u"abc", [](String &s) { s.find('a', 3); }, u"abc", true},
        {"find escaped at length", u"abc", [](String &s) { s.find(UChar{'a'}, UChar{'\\'}, 3); }, u"abc", true},
        {"find s at length", u"abc", [](String &s) { EXPECT_EQ(s.find(String("c"), 3), String::NPOS); }, u"abc", false},
        {"find empty s", u"abc", [](String &s) { EXPECT_EQ(s.find(String(), 0), String::NPOS); }, u"abc", false},
        {"rfind in empty", u"", [](String &s) { EXPECT_EQ(s.rfind(UChar{'a'}), String::NPOS); }, u"", false},
    };
    for (const auto &[what, start, op, expected, throws] : rows) {
        dpxtest::TraceCapture trace(TRC1_ERROR);
        String s = text(start);
        if (throws)
            EXPECT_THROW(op(s), IndexOutOfBoundsException) << what;
        else
            op(s);
        EXPECT_EQ(trace.count("IndexOutOfBounds occurred, throwing exception"), throws ? 1u : 0u) << what;
        EXPECT_EQ(u16(s), expected) << what;
    }
}

TEST(String, TheFindFamilyGivesTheFirstOrLastHitAndSkipsAUnitBehindAnOddRunOfEscapes)
{
    const String s = text(u"abcab\xFF80");
    const std::pair<uint32_t, uint32_t> found[] = {
        {s.find(UChar{'b'}, 2), 4}, {s.find(UChar{'z'}, 0), String::NPOS},
        {s.find('\x80', 0), 5}, {s.find(String("ab"), 1), 3},  // a char is widened with its sign
        {s.find(String("ab"), 4), String::NPOS}, {s.find(String("abcab!!"), 0), String::NPOS},
        {s.rfind(UChar{'a'}), 3}, {s.rfind(0), 6}, {String().rfind(0), 0}};
    for (size_t row = 0; row < std::size(found); ++row)
        EXPECT_EQ(found[row].first, found[row].second) << "row " << row;
    const std::tuple<std::u16string_view, uint32_t, uint32_t> escaped[] = {
        {u"\\\"", 0, String::NPOS}, {u"\\\\\"", 0, 2}, {u"\\\\\\\"", 0, String::NPOS}, {u"a\"", 0, 1},
        {u"\"", 0, 0}, {u"\\\"x\"", 0, 3}, {u"\\\\\\\\\"", 0, 4}, {u"\"a\"", 1, 2}};
    for (const auto &[input, pos, expected] : escaped)
        EXPECT_EQ(text(input).find(UChar{'"'}, UChar{'\\'}, pos), expected) << std::string(input.begin(), input.end());
}

TEST(String, TrimAndEscapingRewriteTheText)
{
    EXPECT_EQ(u16(String("  a b  ").trim()), u"a b");
    EXPECT_EQ(u16(String("\t x \n").trim()), u"x");
    const std::pair<const char *, std::u16string_view> unescaped[] = {
        {"axb", u"ab"}, {"axxb", u"axb"}, {"axxxb", u"axxb"}, {"ax", u"a"}, {"xx", u"x"}, {"xaxb", u"ab"}};
    for (const auto &[input, expected] : unescaped)
        EXPECT_EQ(u16(String(input).removeEscapes(UChar{'x'})), expected) << input;
    EXPECT_EQ(u16(String("cab").insertEscapes(UChar{'x'}, String("ab"))), u"cxaxb");
    EXPECT_EQ(u16(String("axb").insertEscapes(UChar{'x'}, String("ab"))), u"xaxxb");
    EXPECT_EQ(u16(String("axb").insertEscapes(UChar{'x'}, String("x"))), u"axxb");
    EXPECT_EQ(u16(String("ab").insertEscapes(UChar{'x'}, text(std::u16string(1, 0)))), u"abx");  // the terminator
}

TEST(String, ReplaceReplacesEveryOccurrenceFromTheLeftAndTracesItsWork)
{
    dpxtest::TraceCapture trace(TRC1_FLOW);
    const std::tuple<const char *, const char *, const char *, const char *> rows[] = {
        {"aXa", "a", "bb", "bbXbb"}, {"aaa", "aa", "b", "ba"}, {"", "x", "y", ""}, {"abc", "", "z", "abc"},
        {"abab", "ab", "", ""}, {"xyz", "q", "r", "xyz"}, {"ab", "b", "bb", "abb"}};
    for (const auto &[s, from, to, expected] : rows)
        EXPECT_TRUE(String::replace(String(s), String(from), String(to)) == expected) << s;
    EXPECT_TRUE(trace.contains("Str [aXa], replace [a] with [bb]") && trace.contains("Returning [bbXbb]"));
}

TEST(String, ConvertToIntAcceptsAWholeDecimalNumberStrictlyInsideTheLongLimits)
{
    dpxtest::TraceCapture trace(TRC1_ERROR);
    const std::tuple<const char *, bool, int32_t> rows[] = {
        {"42", true, 42}, {" -7", true, -7}, {"", true, 0}, {"   ", false, 0}, {"12 ", false, 0}, {"12a", false, 0},
        {"2147483646", true, 2147483646}, {"2147483647", false, 0}, {"-2147483647", true, -2147483647},
        {"-2147483648", false, 0}, {"12345678901", false, 0}, {"-99999999999", false, 0}};
    for (const auto &[s, accepted, value] : rows) {
        int32_t out = 99;
        EXPECT_EQ(String::convertToInt(String(s), &out), accepted) << s;
        EXPECT_EQ(out, value) << s;
    }
    EXPECT_TRUE(trace.contains("Can't convert, number is too large: 12345678901"));
    EXPECT_TRUE(trace.contains("Can't convert, buffer is not number: 12a"));
}
