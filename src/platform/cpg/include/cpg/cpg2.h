/* Code pages: conversion between the characters of a code page and UTF-16.
 *
 * A locale names one code page by its IBM number (CCSID): 1208 UTF-8, 367
 * US-ASCII, 819 ISO-8859-1, 912 to 923 the other ISO-8859 sets, 1252
 * Windows Latin-1, 37 EBCDIC, 943 and 932 Shift-JIS, 33722 EUC-JP, 1200 and
 * 1201 UTF-16 big-endian, 1202 UTF-16 little-endian, and every other number
 * that ICU knows as "ibm-<number>". The conversions are ICU's.
 *
 * The default locale is the code page of the process's locale as the
 * environment sets it (LC_ALL, LC_CTYPE, LANG, the way setlocale(LC_CTYPE, "")
 * reads them, without changing the locale of the process); a locale that
 * isn't installed counts as the C locale, US-ASCII. The environment variable
 * "CPG2_CODEPAGE", a decimal number, overrides it; a value that isn't a
 * positive decimal number is ignored.
 *
 * All functions are callable from any thread, and several threads may
 * convert through one locale at the same time. No function throws. */
#ifndef CPG_CPG2_H
#define CPG_CPG2_H

#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

#define CPG2_API __attribute__((visibility("default")))

/* Selectors of CPG2_GetLocale. */
#define CPG2_LOCALE_DEFAULT  0x0u        /* the process's default locale */
#define CPG2_LOCALE_CODEPAGE 0x188000Bu  /* the locale of a given code page */

/* Code page numbers that callers name. */
#define CPG2_CP932   932
#define CPG2_CP943   943
#define CPG2_CP1208  1208
#define CPG2_CP33722 33722

/* Status codes, in a status record or a status word. */
#define CPG2_OK              0
#define CPG2_E_INVALID_ARG   1   /* null locale or pointer, negative length, unknown selector */
#define CPG2_E_NO_CODEPAGE   2   /* the code page has no converter, or none could be found */
#define CPG2_E_OVERFLOW      3   /* the destination was too small: its content is cut */
#define CPG2_E_CONVERSION    4   /* the converter failed */
#define CPG2_E_NO_MEMORY     5

/* The outcome of a locale call. */
typedef struct CPG2_STATUS {
    int32_t code;                /* CPG2_OK or a CPG2_E_ code */
} CPG2_STATUS;

/* A locale: one code page and its converter. Opaque. */
typedef struct CPG2_LOCALE CPG2_LOCALE;

/* Returns a new locale, owned by the caller until CPG2_ReleaseLocale.
 * With `selector` CPG2_LOCALE_DEFAULT and `codepage` 0: the default locale.
 * With `selector` CPG2_LOCALE_CODEPAGE: the locale of code page `codepage`.
 * `reserved` is 0. On success `status->code` is CPG2_OK; on failure the
 * result is null and `status->code` says why. `status` may be null. */
CPG2_API CPG2_LOCALE *CPG2_GetLocale(uint32_t selector, int32_t codepage, uint32_t reserved,
                                     CPG2_STATUS *status);

/* The code page number of `locale`; 0 with CPG2_E_INVALID_ARG for a null
 * locale. `status` may be null. */
CPG2_API int32_t CPG2_GetLocaleCodepageId(const CPG2_LOCALE *locale, CPG2_STATUS *status);

/* Gives `locale` back; null is ignored. REQUIRES: no conversion through it
 * is under way. */
CPG2_API void CPG2_ReleaseLocale(CPG2_LOCALE *locale);

/* Converts `source_length` bytes of `source`, in the code page of `locale`,
 * to UTF-16 units at `destination`, writing at most `destination_length`
 * units and a terminating 0 unit only where one fits after the text. A NUL
 * byte inside the source converts to a 0 unit like any other character.
 * Bytes that the code page can't map become a substitution character.
 *
 * Result: the number of units of the whole conversion, also when they don't
 * fit; `destination` may be null when `destination_length` is 0, to learn
 * that number. `*status` is CPG2_OK, CPG2_E_OVERFLOW when the result is
 * above `destination_length` (the destination then holds the first units),
 * or another CPG2_E_ code with a result of 0 and no defined content in the
 * destination. `status` may be null. */
CPG2_API int32_t CPG2_toUTF16(const CPG2_LOCALE *locale, const char *source, int32_t source_length,
                              uint16_t *destination, int32_t destination_length, int32_t *status);

/* Converts `source_length` UTF-16 units of `source` to the code page of
 * `locale` at `destination`, writing at most `destination_length` bytes and
 * a terminating NUL only where one fits after the text. Characters that the
 * code page can't hold become its substitution character.
 *
 * Result and `*status` as for CPG2_toUTF16, counted in bytes; when cut, the
 * destination holds the first bytes, which may end inside a character. */
CPG2_API int32_t CPG2_fromUTF16(const CPG2_LOCALE *locale, const uint16_t *source, int32_t source_length,
                                char *destination, int32_t destination_length, int32_t *status);

#ifdef __cplusplus
}
#endif
#endif
