// Conversion between local characters and UTF-16: the process's code page,
// its two substitutions, and the code-page layer under it.
#include "dpx/text.h"

#include "cpg/cpg2.h"
#include "test_support.h"
#include "trc/trc1.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

using DPX::String;
using DPX::UChar;

// glibc's newlocale keeps the list it makes of LOCPATH; the test of the
// system's Japanese locales sets LOCPATH.
extern "C" __attribute__((visibility("default"))) const char *__lsan_default_suppressions()
{
    return "leak:__argz_add_sep\n";
}

namespace {

// 日本語テキスト in UTF-16 and in three code pages.
const std::u16string kJapanese = u"\u65E5\u672C\u8A9E\u30C6\u30AD\u30B9\u30C8";
const std::string kShiftJis = "\x93\xFA\x96\x7B\x8C\xEA\x83\x65\x83\x4C\x83\x58\x83\x67";
const std::string kEucJp = "\xC6\xFC\xCB\xDC\xB8\xEC\xA5\xC6\xA5\xAD\xA5\xB9\xA5\xC8";
const std::string kUtf8 = "\xE6\x97\xA5\xE6\x9C\xAC\xE8\xAA\x9E\xE3\x83\x86\xE3\x82\xAD\xE3\x82\xB9\xE3\x83\x88";

struct ReleaseLocale {
    void operator()(CPG2_LOCALE *locale) const { CPG2_ReleaseLocale(locale); }
};
using Locale = std::unique_ptr<CPG2_LOCALE, ReleaseLocale>;

Locale locale_for(int32_t codepage)
{
    CPG2_STATUS status{-1};
    Locale locale(CPG2_GetLocale(CPG2_LOCALE_CODEPAGE, codepage, 0, &status));
    EXPECT_EQ(status.code, CPG2_OK) << codepage;
    return locale;
}

int32_t default_codepage()
{
    CPG2_STATUS status{-1};
    Locale locale(CPG2_GetLocale(CPG2_LOCALE_DEFAULT, 0, 0, &status));
    return CPG2_GetLocaleCodepageId(locale.get(), &status);
}

std::u16string u16(const String &s)
{
    return std::u16string(s.getData(), s.getData() + s.length());
}

// Each test picks the process's code page through the environment; the
// strings go back to the real one afterwards.
class CodePage : public ::testing::Test {
protected:
    void TearDown() override
    {
        codepage_.reset();
        lc_all_.reset();
        String::initialize();
    }
    void use_codepage(const char *number)
    {
        codepage_.emplace("CPG2_CODEPAGE", number);
        ASSERT_TRUE(String::initialize());
    }
    void use_locale(const char *name)
    {
        codepage_.emplace("CPG2_CODEPAGE", std::nullopt);
        lc_all_.emplace("LC_ALL", name);
    }

    std::optional<dpxtest::ScopedEnv> codepage_;
    std::optional<dpxtest::ScopedEnv> lc_all_;
};

}  // namespace

TEST_F(CodePage, ShiftJis943IsReplacedBy932)
{
    dpxtest::TraceCapture trace(TRC1_FLOW);
    use_codepage("943");
    EXPECT_TRUE(trace.contains("codepage=943"));
    EXPECT_TRUE(trace.contains("codepage CPG2_CP943 detected, switching to CPG2_CP932"));
    // 932 reads the byte 0x5C as a backslash, 943 as a yen sign.
    EXPECT_EQ(u16(String("\\")), u"\\");
    UChar unit = 0;
    CPG2_toUTF16(locale_for(943).get(), "\\", 1, &unit, 1, nullptr);
    EXPECT_EQ(unit, 0xA5);

    String japanese(kShiftJis.c_str());
    EXPECT_EQ(u16(japanese), kJapanese);
    EXPECT_EQ(std::string(japanese.c_str()), kShiftJis);
}

TEST_F(CodePage, EucJp33722IsReplacedByUtf8)
{
    dpxtest::TraceCapture trace(TRC1_FLOW);
    use_codepage("33722");
    EXPECT_TRUE(trace.contains("codepage=33722"));
    EXPECT_TRUE(trace.contains("codepage 33722 detected, switching to 1208"));
    String japanese(kUtf8.c_str());
    EXPECT_EQ(u16(japanese), kJapanese);
    // Three bytes for every unit: the local form is longer than the text.
    EXPECT_EQ(std::string(japanese.c_str()), kUtf8);
}

TEST_F(CodePage, OtherCodePagesAreUsedAsTheyStand)
{
    dpxtest::TraceCapture trace(TRC1_FLOW);
    use_codepage("819");
    EXPECT_TRUE(trace.contains("codepage=819"));
    EXPECT_FALSE(trace.contains("switching"));
    EXPECT_EQ(u16(String("caf\xE9")), u"caf\u00E9");
    EXPECT_EQ(std::string(String("caf\xE9").c_str()), "caf\xE9");
}

TEST_F(CodePage, InitializeReportsItsResultOnItsExitEvent)
{
    dpxtest::TraceCapture trace(TRC1_ENTRY);
    use_codepage("1208");
    EXPECT_TRUE(trace.contains("dpxstr initialize:"));
    EXPECT_TRUE(trace.contains("EXIT result=1")) << trace.text();
}

TEST_F(CodePage, TheDefaultIsTheCodePageOfTheEnvironmentsLocale)
{
    use_locale("C.UTF-8");
    EXPECT_EQ(default_codepage(), 1208);
    use_locale("C");
    EXPECT_EQ(default_codepage(), 367);
    use_locale("xx_YY.NOWHERE");  // not installed: the C locale
    EXPECT_EQ(default_codepage(), 367);
    codepage_.emplace("CPG2_CODEPAGE", "not a number");
    EXPECT_EQ(default_codepage(), 367);
    codepage_.emplace("CPG2_CODEPAGE", "37");
    EXPECT_EQ(default_codepage(), 37);
}

TEST_F(CodePage, JapaneseLocalesOfTheSystemAreSwitchedAtInitialize)
{
    dpxtest::TempDir locales;
    for (const char *charmap : {"EUC-JP", "SHIFT_JIS"}) {
        std::string command = "localedef -c -i ja_JP -f " + std::string(charmap) + " " + (locales / charmap) +
                              " >/dev/null 2>&1";
        if (std::system(command.c_str()) == -1 || !dpxtest::file_exists(locales / charmap + "/LC_CTYPE"))
            GTEST_SKIP() << "localedef can't make ja_JP." << charmap;
    }
    dpxtest::ScopedEnv locpath("LOCPATH", locales.path());
    dpxtest::TraceCapture trace(TRC1_FLOW);
    use_locale("EUC-JP");
    EXPECT_EQ(default_codepage(), 33722);
    ASSERT_TRUE(String::initialize());
    EXPECT_EQ(u16(String(kUtf8.c_str())), kJapanese);
    use_locale("SHIFT_JIS");
    EXPECT_EQ(default_codepage(), 943);
    ASSERT_TRUE(String::initialize());
    EXPECT_EQ(u16(String(kShiftJis.c_str())), kJapanese);
    EXPECT_EQ(trace.count("switching"), 2u) << trace.text();
}

TEST(CodePageLayer, EucJpAndShiftJisConvertToUtf16AndBackUnchanged)
{
    for (auto [codepage, local] : {std::pair{33722, kEucJp}, std::pair{943, kShiftJis}, std::pair{932, kShiftJis}}) {
        Locale locale = locale_for(codepage);
        UChar units[16] = {};
        int32_t status = -1;
        int32_t n = CPG2_toUTF16(locale.get(), local.data(), static_cast<int32_t>(local.size()), units, 16, &status);
        EXPECT_EQ(status, CPG2_OK);
        EXPECT_EQ(std::u16string(units, units + n), kJapanese) << codepage;
        char bytes[32] = {};
        n = CPG2_fromUTF16(locale.get(), units, n, bytes, sizeof bytes, &status);
        EXPECT_EQ(status, CPG2_OK);
        EXPECT_EQ(std::string(bytes, static_cast<size_t>(n)), local) << codepage;
    }
}

TEST(CodePageLayer, AConversionNeverWritesPastItsDestination)
{
    Locale utf8 = locale_for(1208);
    const std::vector<UChar> japanese(kJapanese.begin(), kJapanese.end());
    char bytes[8];
    std::memset(bytes, '#', sizeof bytes);
    int32_t status = -1;
    EXPECT_EQ(CPG2_fromUTF16(utf8.get(), japanese.data(), 3, bytes, 4, &status), 9);
    EXPECT_EQ(status, CPG2_E_OVERFLOW);
    EXPECT_EQ(std::string(bytes + 4, 4), "####");
    EXPECT_EQ(CPG2_fromUTF16(utf8.get(), japanese.data(), 3, nullptr, 0, &status), 9);

    UChar units[4] = {0xEEEE, 0xEEEE, 0xEEEE, 0xEEEE};
    EXPECT_EQ(CPG2_toUTF16(utf8.get(), kUtf8.data(), 9, units, 2, &status), 3);
    EXPECT_EQ(status, CPG2_E_OVERFLOW);
    EXPECT_EQ(units[2], 0xEEEE);
}

TEST(CodePageLayer, BadArgumentsAndUnknownCodePagesGiveNoLocale)
{
    CPG2_STATUS status{-1};
    EXPECT_EQ(CPG2_GetLocale(CPG2_LOCALE_CODEPAGE, 999999, 0, &status), nullptr);
    EXPECT_EQ(status.code, CPG2_E_NO_CODEPAGE);
    EXPECT_EQ(CPG2_GetLocale(0x1234, 0, 0, &status), nullptr);
    EXPECT_EQ(status.code, CPG2_E_INVALID_ARG);
    EXPECT_EQ(CPG2_GetLocaleCodepageId(nullptr, &status), 0);
    EXPECT_EQ(status.code, CPG2_E_INVALID_ARG);
    UChar unit = 0xEEEE;
    int32_t word = -1;
    EXPECT_EQ(CPG2_toUTF16(nullptr, "a", 1, &unit, 1, &word), 0);
    EXPECT_EQ(word, CPG2_E_INVALID_ARG);
    EXPECT_EQ(unit, 0xEEEE);
    EXPECT_EQ(CPG2_fromUTF16(locale_for(1208).get(), &unit, -1, nullptr, 0, &word), 0);
    EXPECT_EQ(word, CPG2_E_INVALID_ARG);
}
