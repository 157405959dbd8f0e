/* libdpx text classes: UTF-16 text for the other libraries of the system.
 *
 * Text is kept as UTF-16 code units, which every operation treats as plain
 * numbers: nothing here knows surrogate pairs, combining characters or case.
 * "Local characters" are bytes in the code page of the process; the library
 * takes that code page from the process's locale when it is loaded (see
 * String::initialize) and converts with it. Characters that the other side
 * can't hold become substitution characters; while no code page could be
 * had, every conversion gives the empty text.
 *
 * Index errors throw IndexOutOfBoundsException by value and leave the object
 * as it was. A failed allocation throws the allocator's exception (a request
 * that can't be counted in 32 bits throws std::length_error). Nothing else
 * throws.
 *
 * Threads: an object belongs to one thread at a time; reading one from
 * several threads is fine while nobody changes it. The static operations
 * keep no state. */
#ifndef DPX_TEXT_H
#define DPX_TEXT_H

#include <stddef.h>
#include <stdint.h>

#include <type_traits>

#ifndef DPX_API
#define DPX_API __attribute__((visibility("default")))
#endif

namespace DPX {

/* One UTF-16 code unit. */
typedef uint16_t UChar;

/* Copies `count` units from `source` to `destination`, with rising index.
 * The ranges must not overlap. */
DPX_API void CopyMem(UChar *destination, const UChar *source, uint32_t count);

/* Thrown by value at a failed index test; the catcher reads `message`,
 * "line: <line>, file: <path>" of the throw site, cut to fit. */
class DPX_API IndexOutOfBoundsException {
public:
    IndexOutOfBoundsException(int32_t line, const char *file);

    char message[512];
};

/* A growable array of UTF-16 units. Growth is exact: a block is only ever as
 * large as the last request, so appending past the capacity reallocates on
 * every unit; callers that know the final size reserve it first. */
class DPX_API UCharArray {
public:
    /* Empty, capacity 8. */
    UCharArray();
    /* `n` units of no defined value, capacity n + 10. */
    explicit UCharArray(uint32_t n);
    /* Same units, size and capacity as `other`. */
    UCharArray(const UCharArray &other);
    ~UCharArray();
    /* As the copy constructor; nothing happens when both share one block. */
    UCharArray &operator=(const UCharArray &other);

    uint32_t getSize() const { return size; }
    uint32_t getCapacity() const { return capacity; }
    /* The units, unchecked; valid until the next change of the array. */
    const UChar *getData() const { return data; }

    /* Empties the array and gives it a new block of capacity 8. */
    void clear();
    /* Makes the capacity exactly `n` if it is below that; never shrinks. On
     * a failed allocation the array is unchanged. */
    void reserveCapacity(uint32_t n);
    /* Extends the size by `n` units of no defined value. */
    void grow(uint32_t n);

    /* The unit at `i`; throws for `i` at or above the size. */
    const UChar &operator[](uint32_t i) const;
    UChar &operator[](uint32_t i);

    /* Adding units at the end, at the front, or before index `pos` (at most
     * the size; throws above it). A source given by pointer must not lie
     * inside the array. */
    void append(const UChar &c);
    void append(const UChar *p, uint32_t n);
    void prepend(const UChar &c);
    void prepend(const UChar *p, uint32_t n);
    void insert(uint32_t pos, const UChar &c);
    void insert(uint32_t pos, const UChar *p, uint32_t n);

    /* Removes `n` units (one) from `pos`; throws if they don't all lie below
     * the size. Never reallocates: pointers into the block stay valid. */
    void remove(uint32_t pos);
    void remove(uint32_t pos, uint32_t n);

private:
    // Allocates a block of other's capacity and copies other into it,
    // without looking at the old block: the common tail of copying.
    void init(const UCharArray &other);

    UChar *data;        // `capacity` units, owned, never null
    uint32_t size;      // units in use, from index 0; at most `capacity`
    uint32_t capacity;  // units allocated
};

/* An owned, NUL-terminated block of local characters. */
class DPX_API CharStar {
public:
    /* Copies `p`, which is not null and stays the caller's. */
    explicit CharStar(const char *p);
    CharStar(const CharStar &other);
    CharStar &operator=(const CharStar &other);
    ~CharStar();

    /* The characters; they live as long as the holder. */
    operator const char *() const { return chars; }
    operator char *() { return chars; }

private:
    char *chars;
};

/* A UTF-16 string. It always holds a 0 unit behind its text, so getData is a
 * 0-terminated block. A 0 unit may also stand inside the text (through
 * append of a unit, or assign from a pointer and a count): operations that
 * work from length count it, those that work from the terminator (compare,
 * assign from a bare pointer) stop at it.
 *
 * Positions and counts are in code units from 0. */
class DPX_API String {
public:
    /* What the find family gives when nothing is found. */
    static constexpr uint32_t NPOS = 0xFFFFFFFF;

    /* The result of the set-up that runs when the library is loaded. */
    static bool _initialized;

    /* The empty string. */
    String();
    /* A copy, with the text, terminator and capacity of `s`. */
    String(const String &s);
    /* The first `n` units of `s` (all of them if `n` is above its length). */
    String(const String &s, uint32_t n);
    /* From local characters; null gives the empty string. */
    String(const char *p);
    /* From at most the first `n` bytes of `p`, cut on a byte. */
    String(const char *p, uint32_t n);
    /* From 0-terminated units; null gives the empty string. */
    String(const UChar *p);
    virtual ~String();

    String &operator=(const String &s);
    String &operator=(const UChar *p);

    /* Each replaces the text and returns the string. A source given by
     * pointer must not lie inside this string; null gives the empty
     * string. A count `n` of a String source above its length takes all of
     * it; with units, `n` units are taken as they stand, 0 units included;
     * with local characters, at most `n` bytes up to a NUL. */
    String &assign(const String &s);
    String &assign(const String &s, uint32_t n);
    String &assign(const UChar *p);
    String &assign(const UChar *p, uint32_t n);
    String &assign(const char *p);
    String &assign(const char *p, uint32_t n);
    /* The empty string, with capacity 8. */
    void clear();

    /* The number of units without the terminator; the two are the same. */
    uint32_t length() const;
    uint32_t size() const;
    /* The 0-terminated units; valid until the next change of the string. */
    const UChar *getData() const { return units.getData(); }
    /* The text in the local code page, up to its first 0 unit, whole. */
    CharStar c_str() const;

    /* Local characters to a new block of 0-terminated units: all of `p`, or
     * at most its first `n` bytes. Null `p` gives null. The caller owns the
     * block and gives it back with releaseUnicodeString. */
    static UChar *createUnicodeString(const char *p);
    static UChar *createUnicodeString(const char *p, uint32_t n);
    /* A new block with a copy of the 0-terminated units `p`; null gives null. */
    static UChar *copyUnicodeString(const UChar *p);
    /* Gives back a block of the two above; null is ignored. */
    static void releaseUnicodeString(UChar *p);
    /* Takes the process's code page for all conversions, replacing the one
     * in use: 943 becomes 932, 33722 becomes 1208. True if there is one.
     * REQUIRES: no other thread uses the text classes meanwhile. */
    static bool initialize();

    /* Code unit order up to the first 0 unit: the difference of the first
     * differing units, or -1 / 1 when one text is a prefix of the other. */
    static int compare(const String &a, const String &b);
    static int compare(const UChar *p, const UChar *q);
    /* `s` with every occurrence of `from` replaced by `to`, from the left,
     * not overlapping. An empty `from` replaces nothing. */
    static String replace(const String &s, const String &from, const String &to);
    /* iswspace of the C library on the unit, under the current locale. */
    static bool isWhiteSpace(UChar c);
    /* Reads a decimal number, with leading blanks and a sign, filling the
     * whole text (the empty text reads as 0). True with the value in `*out`
     * for -2147483647 to 2147483646; false with 0 in `*out` otherwise. */
    static bool convertToInt(const String &s, int32_t *out);

    /* Appending a unit, all of `s`, or its first `n` units (throws if `n` is
     * above its length). `s` may be this string. */
    String &append(UChar c);
    String &append(const String &s);
    String &append(const String &s, uint32_t n);
    /* Removes `n` units from `pos`, or all from `pos`. Throws for a count of
     * 0 or units beyond the text; so erase(length()) throws. */
    String &erase(uint32_t pos);
    String &erase(uint32_t pos, uint32_t n);
    /* Removes leading and trailing white space (isWhiteSpace); a string of
     * white space alone is cleared. */
    String &trim();
    /* Removes every `esc` that isn't followed by another `esc`: a doubled
     * escape becomes one. */
    String &removeEscapes(UChar esc);
    /* Puts `esc` in front of every unit that is in `set`. */
    String &insertEscapes(UChar esc, const String &set);
    /* `n` units from `pos`, or all from `pos`. Throws like erase. */
    String substr(uint32_t pos) const;
    String substr(uint32_t pos, uint32_t n) const;

    /* The first index at or above `pos` that holds `c`; throws for `pos` at
     * or above the length. A local character is widened with its sign (0x80
     * becomes 0xFF80), without conversion. */
    uint32_t find(UChar c, uint32_t pos) const;
    uint32_t find(char c, uint32_t pos) const;
    /* As above, skipping a `c` behind an odd number of `esc` units. */
    uint32_t find(UChar c, UChar esc, uint32_t pos) const;
    /* The first index at or above `pos` where all of `s` stands; NPOS if
     * it can't stand there, and for an empty `s`. Never throws. */
    uint32_t find(const String &s, uint32_t pos) const;
    /* The last index that holds `c`, the terminator included (so rfind(0)
     * gives the length). Never throws. */
    uint32_t rfind(UChar c) const;

    /* The unit at `i`; `i` equal to the length gives the terminator 0, above
     * it throws. By value in both forms. */
    UChar operator[](uint32_t i) const;
    UChar operator[](uint32_t i);

protected:
    UCharArray units;  // the text and its terminator
};

DPX_API String operator+(const String &a, const String &b);
DPX_API bool operator==(const String &a, const String &b);
DPX_API bool operator==(const char *p, const String &s);
DPX_API bool operator==(const String &s, const char *p);
DPX_API bool operator!=(const String &a, const String &b);

// Layouts are part of the exported interface.
static_assert(sizeof(UChar) == 2);
static_assert(std::is_standard_layout_v<IndexOutOfBoundsException> &&
              !std::is_polymorphic_v<IndexOutOfBoundsException>);
static_assert(sizeof(IndexOutOfBoundsException) == 512 && offsetof(IndexOutOfBoundsException, message) == 0);
static_assert(std::is_standard_layout_v<UCharArray> && !std::is_polymorphic_v<UCharArray>);
static_assert(sizeof(UCharArray) == sizeof(UChar *) + 2 * sizeof(uint32_t));
static_assert(std::is_standard_layout_v<CharStar> && sizeof(CharStar) == sizeof(char *));
// One virtual table pointer, then the array.
static_assert(std::is_polymorphic_v<String> && sizeof(String) == sizeof(void *) + sizeof(UCharArray));

}  // namespace DPX

#endif
