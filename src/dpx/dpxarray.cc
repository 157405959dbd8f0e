// The UTF-16 array of the text classes, and the index exception they throw.
#include "dpx/text.h"

#include "trc/trc1.h"

#include <cstdio>
#include <cstring>
#include <stdexcept>

TRC1_DEFINE_UNIT("dpxarray");

// A failed index test: the entry event at the failing line (flag 0x40), the
// message under flag 0x80, the throw; all with the line of the macro's use.
// The traced function's descriptor lives in this cold branch only, so a
// passing test costs nothing but the comparison.
#define DPX_ARRAY_INDEX_ERROR()                                                  \
    do {                                                                         \
        TRC1_FUNCTION();                                                         \
        TRC1_ERROR_MSG("IndexOutOfBounds in %s:%d", __func__, __LINE__);         \
        throw IndexOutOfBoundsException(__LINE__, __FILE__);                     \
    } while (0)

namespace DPX {

namespace {

constexpr uint32_t kInitialCapacity = 8;
constexpr uint32_t kSizedSlack = 10;

// `size` + `n` as a count of units; a sum beyond 32 bits can't be a block.
uint32_t units_after(uint32_t size, uint32_t n)
{
    if (n > UINT32_MAX - size)
        throw std::length_error("UCharArray: more than 2^32 - 1 units");
    return size + n;
}

}  // namespace

void CopyMem(UChar *destination, const UChar *source, uint32_t count)
{
    for (uint32_t i = 0; i < count; ++i)
        destination[i] = source[i];
}

IndexOutOfBoundsException::IndexOutOfBoundsException(int32_t line, const char *file)
{
    // snprintf cuts a long path: the text always fits the member.
    std::snprintf(message, sizeof message, "line: %d, file: %s", static_cast<int>(line),
                  file != nullptr ? file : "");
}

UCharArray::UCharArray() : data(new UChar[kInitialCapacity]), size(0), capacity(kInitialCapacity) {}

UCharArray::UCharArray(uint32_t n)
    : data(new UChar[units_after(n, kSizedSlack)]), size(n), capacity(n + kSizedSlack)
{
}

UCharArray::UCharArray(const UCharArray &other) : data(nullptr), size(0), capacity(0)
{
    init(other);
}

UCharArray::~UCharArray()
{
    delete[] data;
}

UCharArray &UCharArray::operator=(const UCharArray &other)
{
    if (data != other.data) {
        UChar *old = data;
        init(other);
        delete[] old;
    }
    return *this;
}

void UCharArray::init(const UCharArray &other)
{
    UChar *block = new UChar[other.capacity];
    CopyMem(block, other.data, other.size);
    data = block;
    capacity = other.capacity;
    size = other.size;
}

void UCharArray::clear()
{
    UChar *block = new UChar[kInitialCapacity];
    delete[] data;
    data = block;
    size = 0;
    capacity = kInitialCapacity;
}

void UCharArray::reserveCapacity(uint32_t n)
{
    if (n <= capacity)
        return;
    UChar *block = new UChar[n];
    CopyMem(block, data, size);
    UChar *old = data;
    data = block;
    capacity = n;
    delete[] old;
}

void UCharArray::grow(uint32_t n)
{
    uint32_t grown = units_after(size, n);
    if (capacity <= grown)
        reserveCapacity(grown);
    size = grown;
}

const UChar &UCharArray::operator[](uint32_t i) const
{
    if (i >= size)
        DPX_ARRAY_INDEX_ERROR();
    return data[i];
}

UChar &UCharArray::operator[](uint32_t i)
{
    if (i >= size)
        DPX_ARRAY_INDEX_ERROR();
    return data[i];
}

void UCharArray::append(const UChar &c)
{
    // The value is taken first: a reallocation would free a unit of this array.
    UChar unit = c;
    reserveCapacity(units_after(size, 1));
    data[size] = unit;
    ++size;
}

void UCharArray::append(const UChar *p, uint32_t n)
{
    reserveCapacity(units_after(size, n));
    CopyMem(data + size, p, n);
    size += n;
}

void UCharArray::prepend(const UChar &c)
{
    UChar unit = c;
    insert(0, &unit, 1);
}

void UCharArray::prepend(const UChar *p, uint32_t n)
{
    insert(0, p, n);
}

void UCharArray::insert(uint32_t pos, const UChar &c)
{
    UChar unit = c;
    insert(pos, &unit, 1);
}

void UCharArray::insert(uint32_t pos, const UChar *p, uint32_t n)
{
    if (pos > size)
        DPX_ARRAY_INDEX_ERROR();
    reserveCapacity(units_after(size, n));
    if (size - pos != 0)
        std::memmove(data + pos + n, data + pos, (size - pos) * sizeof(UChar));
    CopyMem(data + pos, p, n);
    size += n;
}

void UCharArray::remove(uint32_t pos)
{
    remove(pos, 1);
}

void UCharArray::remove(uint32_t pos, uint32_t n)
{
    if (static_cast<uint64_t>(pos) + n > size)
        DPX_ARRAY_INDEX_ERROR();
    uint32_t tail = size - (pos + n);
    if (tail != 0)
        std::memmove(data + pos, data + pos + n, tail * sizeof(UChar));
    size -= n;
}

}  // namespace DPX
