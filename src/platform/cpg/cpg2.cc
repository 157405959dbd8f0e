// Code pages over ICU's converters.
#include "cpg/cpg2.h"

#include "plt/plt1.h"

#include <unicode/ucnv.h>

#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <langinfo.h>
#include <locale.h>
#include <memory>
#include <new>
#include <strings.h>
#include <type_traits>

// A locale keeps ICU's name of its converter, not a converter: an ICU
// converter carries the state of one conversion, so every conversion opens
// its own and locales can be shared between threads.
struct CPG2_LOCALE {
    int32_t codepage;
    char converter[UCNV_MAX_CONVERTER_NAME_LENGTH];
};

namespace {

// IBM numbers of the character sets, as the C library names them, for which
// ICU knows no IBM name.
struct CodesetNumber {
    const char *codeset;
    int32_t codepage;
};
constexpr CodesetNumber kCodesetNumbers[] = {
    {"EUC-JP", CPG2_CP33722},
    {"BIG5", 950},
    {"GBK", 1386},
    {"EUC-TW", 964},
};

// The character set of the C locale, which a process has where the
// environment names a locale that isn't installed.
constexpr const char *kCLocaleCodeset = "ANSI_X3.4-1968";

struct FreeLocale {
    void operator()(locale_t locale) const { freelocale(locale); }
};
using LocaleHolder = std::unique_ptr<std::remove_pointer_t<locale_t>, FreeLocale>;

void set_status(CPG2_STATUS *status, int32_t code)
{
    if (status != nullptr)
        status->code = code;
}

void set_status(int32_t *status, int32_t code)
{
    if (status != nullptr)
        *status = code;
}

int32_t code_of(UErrorCode error)
{
    if (U_SUCCESS(error))
        return CPG2_OK;
    if (error == U_BUFFER_OVERFLOW_ERROR)
        return CPG2_E_OVERFLOW;
    if (error == U_MEMORY_ALLOCATION_ERROR)
        return CPG2_E_NO_MEMORY;
    return CPG2_E_CONVERSION;
}

// A whole positive number that fits, else 0.
int32_t parse_codepage(const char *text)
{
    uint32_t value = 0;
    PLT1_ParseNumber(text, 1, INT32_MAX, &value);
    return static_cast<int32_t>(value);
}

// IBM number of a character set as nl_langinfo names it; 0 if none is known.
int32_t codepage_of_codeset(const char *codeset)
{
    UErrorCode error = U_ZERO_ERROR;
    const char *ibm_name = ucnv_getStandardName(codeset, "IBM", &error);
    if (ibm_name != nullptr && strncasecmp(ibm_name, "ibm-", 4) == 0)
        return parse_codepage(ibm_name + 4);
    for (const CodesetNumber &entry : kCodesetNumbers) {
        if (strcasecmp(entry.codeset, codeset) == 0)
            return entry.codepage;
    }
    return 0;
}

int32_t default_codepage()
{
    if (int32_t chosen = parse_codepage(PLT1_GetEnv("CPG2_CODEPAGE", nullptr)))
        return chosen;
    // The environment's locale as setlocale(LC_CTYPE, "") would take it, but
    // without changing the locale of the process.
    LocaleHolder environment(newlocale(LC_CTYPE_MASK, "", nullptr));
    const char *codeset = environment ? nl_langinfo_l(CODESET, environment.get()) : kCLocaleCodeset;
    return codepage_of_codeset(codeset);
}

CPG2_LOCALE *make_locale(int32_t codepage, CPG2_STATUS *status)
{
    if (codepage <= 0) {
        set_status(status, CPG2_E_NO_CODEPAGE);
        return nullptr;
    }
    char alias[32];
    std::snprintf(alias, sizeof alias, "ibm-%d", static_cast<int>(codepage));
    UErrorCode error = U_ZERO_ERROR;
    icu::LocalUConverterPointer converter(ucnv_open(alias, &error));
    const char *name = U_SUCCESS(error) ? ucnv_getName(converter.getAlias(), &error) : nullptr;
    if (name == nullptr || U_FAILURE(error)) {
        set_status(status, error == U_MEMORY_ALLOCATION_ERROR ? CPG2_E_NO_MEMORY : CPG2_E_NO_CODEPAGE);
        return nullptr;
    }
    auto *locale = new (std::nothrow) CPG2_LOCALE;
    if (locale == nullptr) {
        set_status(status, CPG2_E_NO_MEMORY);
        return nullptr;
    }
    locale->codepage = codepage;
    std::snprintf(locale->converter, sizeof locale->converter, "%s", name);
    set_status(status, CPG2_OK);
    return locale;
}

bool valid_conversion(const CPG2_LOCALE *locale, const void *source, int32_t source_length,
                      const void *destination, int32_t destination_length)
{
    return locale != nullptr && source != nullptr && source_length >= 0 && destination_length >= 0 &&
           (destination != nullptr || destination_length == 0);
}

// Runs one conversion on a converter of its own; `convert` is ICU's
// ucnv_toUChars or ucnv_fromUChars with its arguments bound.
template <typename Convert>
int32_t run_conversion(const CPG2_LOCALE *locale, int32_t *status, Convert convert)
{
    UErrorCode error = U_ZERO_ERROR;
    icu::LocalUConverterPointer converter(ucnv_open(locale->converter, &error));
    if (U_FAILURE(error)) {
        set_status(status, code_of(error));
        return 0;
    }
    int32_t length = convert(converter.getAlias(), &error);
    set_status(status, code_of(error));
    return U_SUCCESS(error) || error == U_BUFFER_OVERFLOW_ERROR ? length : 0;
}

}  // namespace

extern "C" {

CPG2_LOCALE *CPG2_GetLocale(uint32_t selector, int32_t codepage, uint32_t reserved, CPG2_STATUS *status)
{
    if (reserved != 0) {
        set_status(status, CPG2_E_INVALID_ARG);
        return nullptr;
    }
    if (selector == CPG2_LOCALE_DEFAULT && codepage == 0)
        return make_locale(default_codepage(), status);
    if (selector == CPG2_LOCALE_CODEPAGE)
        return make_locale(codepage, status);
    set_status(status, CPG2_E_INVALID_ARG);
    return nullptr;
}

int32_t CPG2_GetLocaleCodepageId(const CPG2_LOCALE *locale, CPG2_STATUS *status)
{
    if (locale == nullptr) {
        set_status(status, CPG2_E_INVALID_ARG);
        return 0;
    }
    set_status(status, CPG2_OK);
    return locale->codepage;
}

void CPG2_ReleaseLocale(CPG2_LOCALE *locale)
{
    delete locale;
}

int32_t CPG2_toUTF16(const CPG2_LOCALE *locale, const char *source, int32_t source_length, uint16_t *destination,
                     int32_t destination_length, int32_t *status)
{
    if (!valid_conversion(locale, source, source_length, destination, destination_length)) {
        set_status(status, CPG2_E_INVALID_ARG);
        return 0;
    }
    // ICU's UChar is char16_t: the same width and representation as uint16_t.
    auto *units = reinterpret_cast<UChar *>(destination);
    return run_conversion(locale, status, [&](UConverter *converter, UErrorCode *error) {
        return ucnv_toUChars(converter, units, destination_length, source, source_length, error);
    });
}

int32_t CPG2_fromUTF16(const CPG2_LOCALE *locale, const uint16_t *source, int32_t source_length,
                       char *destination, int32_t destination_length, int32_t *status)
{
    if (!valid_conversion(locale, source, source_length, destination, destination_length)) {
        set_status(status, CPG2_E_INVALID_ARG);
        return 0;
    }
    const auto *units = reinterpret_cast<const UChar *>(source);
    return run_conversion(locale, status, [&](UConverter *converter, UErrorCode *error) {
        return ucnv_fromUChars(converter, destination, destination_length, units, source_length, error);
    });
}

}  // extern "C"
