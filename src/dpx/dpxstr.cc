// The string classes: storage, conversion to and from the local code page,
// the character holder, and the operations on the text.
#include "dpx/text.h"

#include "cpg/cpg2.h"
#include "trc/trc1.h"

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <stdexcept>
#include <wctype.h>

TRC1_DEFINE_UNIT("dpxstr");

// A failed bounds test of a string operation: the entry event at the failing
// line (flag 0x40), the message under flag 0x80, the throw; all with the line
// of the macro's use. The descriptor lives in this cold branch only.
#define DPX_STRING_INDEX_ERROR()                                                 \
    do {                                                                         \
        TRC1_FUNCTION();                                                         \
        TRC1_ERROR_MSG("IndexOutOfBounds occurred, throwing exception");         \
        throw IndexOutOfBoundsException(__LINE__, __FILE__);                     \
    } while (0)

namespace DPX {

namespace {

// The locale of every conversion, one for the process. Written at load (and
// by a later initialize), read by all conversions.
CPG2_LOCALE *glbLocale = nullptr;

// Code pages that aren't used as they stand, and the one used instead.
struct Substitution {
    int32_t read;
    int32_t used;
    const char *message;
};
constexpr Substitution kSubstitutions[] = {
    {CPG2_CP943, CPG2_CP932, "codepage CPG2_CP943 detected, switching to CPG2_CP932"},
    {CPG2_CP33722, CPG2_CP1208, "codepage 33722 detected, switching to 1208"},
};

// The limits of a 32-bit long: strtol clamps an overflow to them, so they
// are refused like any overflow.
constexpr long kLongMax32 = 2147483647L;
constexpr long kLongMin32 = -2147483647L - 1;

struct ReleaseUnits {
    void operator()(UChar *p) const { String::releaseUnicodeString(p); }
};
using UnitsHolder = std::unique_ptr<UChar[], ReleaseUnits>;

// A length as the code-page library counts it.
int32_t cpg_length(size_t n)
{
    if (n > static_cast<size_t>(INT32_MAX))
        throw std::length_error("DPX::String: text too long to convert");
    return static_cast<int32_t>(n);
}

// Units up to the first 0 unit.
uint32_t count_units(const UChar *p)
{
    size_t n = 0;
    while (p[n] != 0)
        ++n;
    if (n >= UINT32_MAX)
        throw std::length_error("DPX::String: more than 2^32 - 2 units");
    return static_cast<uint32_t>(n);
}

// A failed set-up at load is tried again by every conversion.
void ensure_locale()
{
    if (!String::_initialized)
        String::initialize();
}

// `length` bytes of local characters to a new, 0-terminated block of units.
// A block of one unit per byte holds the conversion in every common code
// page; where it doesn't, the converter tells the size and the conversion
// runs again, so nothing is cut. The block is zeroed, which terminates it
// (also when no locale could be had and nothing is written).
UChar *to_units(const char *p, size_t length)
{
    int32_t n = cpg_length(length);
    std::unique_ptr<UChar[]> block(new UChar[static_cast<size_t>(n) + 1]());
    int32_t status = CPG2_OK;
    int32_t needed = CPG2_toUTF16(glbLocale, p, n, block.get(), n, &status);
    if (needed > n) {
        block.reset(new UChar[static_cast<size_t>(needed) + 1]());
        CPG2_toUTF16(glbLocale, p, n, block.get(), needed, &status);
    }
    return block.release();
}

char *copy_chars(const char *p)
{
    size_t n = std::strlen(p) + 1;
    char *block = new char[n];
    std::memcpy(block, p, n);
    return block;
}

}  // namespace

// ---------------------------------------------------------------------------
// Locale

bool String::_initialized = String::initialize();

bool String::initialize()
{
    TRC1_FUNCTION();
    CPG2_STATUS status;
    if (glbLocale != nullptr)
        CPG2_ReleaseLocale(glbLocale);
    glbLocale = CPG2_GetLocale(CPG2_LOCALE_DEFAULT, 0, 0, &status);
    int32_t codepage = CPG2_GetLocaleCodepageId(glbLocale, &status);
    TRC1_FLOW_MSG("codepage=%d", static_cast<int>(codepage));
    for (const Substitution &substitution : kSubstitutions) {
        if (codepage != substitution.read)
            continue;
        TRC1_FLOW_MSG("%s", substitution.message);
        CPG2_LOCALE *used = CPG2_GetLocale(CPG2_LOCALE_CODEPAGE, substitution.used, 0, &status);
        CPG2_ReleaseLocale(glbLocale);
        glbLocale = used;
        break;
    }
    bool ready = glbLocale != nullptr;
    trc1_scope_.set_result(ready);
    return ready;
}

// ---------------------------------------------------------------------------
// Construction and assignment

String::String()
{
    units.append(UChar{0});
}

String::String(const String &s) : units(s.units) {}

String::String(const String &s, uint32_t n)
{
    assign(s, n);
}

String::String(const char *p)
{
    assign(p);
}

String::String(const char *p, uint32_t n)
{
    assign(p, n);
}

String::String(const UChar *p)
{
    assign(p);
}

String::~String() = default;

String &String::operator=(const String &s)
{
    if (&s != this)
        assign(s);
    return *this;
}

String &String::operator=(const UChar *p)
{
    return assign(p);
}

String &String::assign(const String &s)
{
    units = s.units;
    return *this;
}

String &String::assign(const String &s, uint32_t n)
{
    uint32_t count = n < s.length() ? n : s.length();
    if (&s == this) {
        units.remove(count, length() - count);
        return *this;
    }
    return assign(s.getData(), count);
}

String &String::assign(const UChar *p)
{
    if (p == nullptr) {
        clear();
        return *this;
    }
    return assign(p, count_units(p));
}

String &String::assign(const UChar *p, uint32_t n)
{
    clear();
    if (p != nullptr && n != 0) {
        // One allocation for the text and its terminator; the string stays
        // valid, if empty, should it fail.
        if (n == UINT32_MAX)
            throw std::length_error("DPX::String: more than 2^32 - 2 units");
        units.reserveCapacity(n + 1);
        units.insert(0, p, n);
    }
    return *this;
}

String &String::assign(const char *p)
{
    if (p == nullptr) {
        clear();
        return *this;
    }
    UnitsHolder converted(createUnicodeString(p));
    return assign(converted.get());
}

String &String::assign(const char *p, uint32_t n)
{
    if (p == nullptr) {
        clear();
        return *this;
    }
    UnitsHolder converted(createUnicodeString(p, n));
    return assign(converted.get());
}

void String::clear()
{
    units.clear();
    units.append(UChar{0});
}

// ---------------------------------------------------------------------------
// Access and conversion

uint32_t String::length() const
{
    return units.getSize() - 1;
}

uint32_t String::size() const
{
    return length();
}

CharStar String::c_str() const
{
    // First with one byte per unit, terminator included; a local form that
    // needs more (a multi-byte code page) is converted again into a block
    // of the size the converter asks for, so the text is never cut. The
    // zeroed block terminates the result.
    int32_t n = cpg_length(units.getSize());
    std::unique_ptr<char[]> block(new char[static_cast<size_t>(n) + 1]());
    int32_t status = CPG2_OK;
    int32_t needed = CPG2_fromUTF16(glbLocale, getData(), n, block.get(), n, &status);
    if (needed > n) {
        block.reset(new char[static_cast<size_t>(needed) + 1]());
        CPG2_fromUTF16(glbLocale, getData(), n, block.get(), needed, &status);
    }
    return CharStar(block.get());
}

UChar *String::createUnicodeString(const char *p)
{
    ensure_locale();
    if (p == nullptr)
        return nullptr;
    return to_units(p, std::strlen(p));
}

UChar *String::createUnicodeString(const char *p, uint32_t n)
{
    ensure_locale();
    if (p == nullptr)
        return nullptr;
    // The cut falls on a byte, not on a character of the code page.
    return to_units(p, strnlen(p, n));
}

UChar *String::copyUnicodeString(const UChar *p)
{
    if (p == nullptr)
        return nullptr;
    uint32_t n = count_units(p);
    auto *block = new UChar[static_cast<size_t>(n) + 1];
    CopyMem(block, p, n + 1);
    return block;
}

void String::releaseUnicodeString(UChar *p)
{
    delete[] p;
}

// ---------------------------------------------------------------------------
// Character holder

CharStar::CharStar(const char *p) : chars(copy_chars(p != nullptr ? p : "")) {}

CharStar::CharStar(const CharStar &other) : chars(copy_chars(other.chars)) {}

CharStar &CharStar::operator=(const CharStar &other)
{
    if (&other != this) {
        char *block = copy_chars(other.chars);
        delete[] chars;
        chars = block;
    }
    return *this;
}

CharStar::~CharStar()
{
    delete[] chars;
}

// ---------------------------------------------------------------------------
// Comparing and searching

int String::compare(const String &a, const String &b)
{
    return compare(a.getData(), b.getData());
}

int String::compare(const UChar *p, const UChar *q)
{
    while (*p != 0 && *q != 0) {
        int difference = static_cast<int>(*p) - static_cast<int>(*q);
        ++p;
        ++q;
        if (difference != 0)
            return difference;
    }
    if (*q != 0)
        return -1;
    if (*p != 0)
        return 1;
    return 0;
}

uint32_t String::find(UChar c, uint32_t pos) const
{
    uint32_t end = length();
    if (pos >= end)
        DPX_STRING_INDEX_ERROR();
    const UChar *text = getData();
    for (uint32_t i = pos; i < end; ++i) {
        if (text[i] == c)
            return i;
    }
    return NPOS;
}

uint32_t String::find(char c, uint32_t pos) const
{
    // Widened with its sign: a byte of 0x80 or above becomes 0xFF80 and up.
    return find(static_cast<UChar>(static_cast<signed char>(c)), pos);
}

uint32_t String::find(UChar c, UChar esc, uint32_t pos) const
{
    uint32_t end = length();
    if (pos >= end)
        DPX_STRING_INDEX_ERROR();
    const UChar *text = getData();
    for (uint32_t i = pos; i < end; ++i) {
        if (text[i] != c)
            continue;
        if (i == 0 || text[i - 1] != esc)
            return i;
        // Escapes in front of the one that precedes c: an odd number of them
        // means an even number before c, which escape each other.
        uint32_t run = 0;
        for (uint32_t j = i - 1; j > 0 && text[j - 1] == esc; --j)
            ++run;
        if (run % 2 == 1)
            return i;
    }
    return NPOS;
}

uint32_t String::find(const String &s, uint32_t pos) const
{
    uint32_t needle = s.length();
    uint32_t end = length();
    if (needle == 0 || needle > end || pos > end - needle)
        return NPOS;
    const UChar *text = getData();
    const UChar *wanted = s.getData();
    for (uint32_t i = pos; i <= end - needle; ++i) {
        if (text[i] != wanted[0])
            continue;
        uint32_t k = 1;
        while (k < needle && text[i + k] == wanted[k])
            ++k;
        if (k == needle)
            return i;
    }
    return NPOS;
}

uint32_t String::rfind(UChar c) const
{
    const UChar *text = getData();
    for (uint32_t i = length() + 1; i-- > 0;) {
        if (text[i] == c)
            return i;
    }
    return NPOS;
}

UChar String::operator[](uint32_t i) const
{
    if (i > length())
        DPX_STRING_INDEX_ERROR();
    return getData()[i];
}

UChar String::operator[](uint32_t i)
{
    if (i > length())
        DPX_STRING_INDEX_ERROR();
    return getData()[i];
}

// ---------------------------------------------------------------------------
// Changing the text

String &String::append(UChar c)
{
    uint32_t end = length();
    units.grow(1);
    units[end] = c;
    units[end + 1] = 0;
    return *this;
}

String &String::append(const String &s)
{
    return append(s, s.length());
}

String &String::append(const String &s, uint32_t n)
{
    if (n > s.length())
        DPX_STRING_INDEX_ERROR();
    if (n > UINT32_MAX - units.getSize())
        throw std::length_error("DPX::String: more than 2^32 - 1 units");
    // Reserved first, so nothing moves below: s may be this string.
    units.reserveCapacity(n + units.getSize());
    units.remove(length());
    units.append(s.getData(), n);
    units.append(UChar{0});
    return *this;
}

String &String::erase(uint32_t pos)
{
    if (pos >= length())
        DPX_STRING_INDEX_ERROR();
    return erase(pos, length() - pos);
}

String &String::erase(uint32_t pos, uint32_t n)
{
    if (n == 0 || static_cast<uint64_t>(pos) + n > length())
        DPX_STRING_INDEX_ERROR();
    units.remove(pos, n);
    return *this;
}

String String::substr(uint32_t pos) const
{
    if (pos >= length())
        DPX_STRING_INDEX_ERROR();
    return substr(pos, length() - pos);
}

String String::substr(uint32_t pos, uint32_t n) const
{
    if (n == 0 || static_cast<uint64_t>(pos) + n > length())
        DPX_STRING_INDEX_ERROR();
    String part;
    part.assign(getData() + pos, n);
    return part;
}

bool String::isWhiteSpace(UChar c)
{
    return iswspace(static_cast<wint_t>(c)) != 0;
}

String &String::trim()
{
    const UChar *text = getData();
    uint32_t end = length();
    uint32_t leading = 0;
    while (text[leading] != 0 && isWhiteSpace(text[leading]))
        ++leading;
    if (leading >= end) {
        clear();
        return *this;
    }
    // Stops at the latest on the unit at `leading`, which isn't white space.
    uint32_t kept = end;
    while (isWhiteSpace(text[kept - 1]))
        --kept;
    units.remove(kept, end - kept);
    if (leading != 0)
        units.remove(0, leading);
    return *this;
}

String &String::removeEscapes(UChar esc)
{
    // remove never reallocates, so `text` stays valid through the walk.
    const UChar *text = getData();
    uint32_t i = 0;
    while (text[i] != 0) {
        if (text[i] == esc && text[i + 1] != esc) {
            // The unit that moves to i isn't esc: the next pass steps over it.
            units.remove(i);
            continue;
        }
        ++i;
    }
    return *this;
}

String &String::insertEscapes(UChar esc, const String &set)
{
    // The set is read throughout the walk, so it can't be the text that
    // changes.
    String own;
    const String *chars = &set;
    if (&set == this) {
        own = set;
        chars = &own;
    }
    const UChar *members = chars->getData();
    uint32_t member_count = chars->length();
    for (uint32_t i = 0; i <= length(); ++i) {
        UChar unit = getData()[i];
        for (uint32_t k = 0; k < member_count; ++k) {
            if (members[k] == unit) {
                units.insert(i, esc);
                ++i;
                break;
            }
        }
    }
    return *this;
}

String String::replace(const String &s, const String &from, const String &to)
{
    TRC1_FUNCTION();
    TRC1_FLOW_MSG("Str [%s], replace [%s] with [%s]", static_cast<const char *>(s.c_str()),
                  static_cast<const char *>(from.c_str()), static_cast<const char *>(to.c_str()));
    String result;
    if (s.find(from, 0) == NPOS) {
        result = s;
    } else {
        uint32_t pos = 0;
        while (pos < s.length()) {
            uint32_t i = s.find(from, pos);
            if (i == NPOS)
                break;
            if (i > pos)
                result.append(s.substr(pos, i - pos));
            result.append(to);
            pos = i + from.length();
        }
        if (pos < s.length())
            result.append(s.substr(pos));
    }
    TRC1_FLOW_MSG("Returning [%s]", static_cast<const char *>(result.c_str()));
    return result;
}

bool String::convertToInt(const String &s, int32_t *out)
{
    TRC1_FUNCTION();
    if (out == nullptr)
        return false;
    CharStar text = s.c_str();
    *out = 0;
    errno = 0;
    char *end = nullptr;
    long value = std::strtol(text, &end, 10);
    if (*end != '\0') {
        TRC1_ERROR_MSG("Can't convert, buffer is not number: %s", static_cast<const char *>(text));
        return false;
    }
    // Also where long is wider: the accepted range is that of a 32-bit long
    // without its two limits.
    if (value >= kLongMax32 || value <= kLongMin32) {
        TRC1_ERROR_MSG("Can't convert, number is too large: %s", static_cast<const char *>(text));
        return false;
    }
    *out = static_cast<int32_t>(value);
    return true;
}

// ---------------------------------------------------------------------------
// Operators

String operator+(const String &a, const String &b)
{
    String sum(a);
    sum.append(b);
    return sum;
}

bool operator==(const String &a, const String &b)
{
    return String::compare(a, b) == 0;
}

bool operator==(const char *p, const String &s)
{
    return String(p) == s;
}

bool operator==(const String &s, const char *p)
{
    return s == String(p);
}

bool operator!=(const String &a, const String &b)
{
    return String::compare(a, b) != 0;
}

}  // namespace DPX
