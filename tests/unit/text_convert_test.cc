// Conversion between local characters and UTF-16: the process's code page,
// its two substitutions, and the code-page layer under it.
#include "dpx/text.h"

#include "cpg/cpg2.h"
#include "test_support.h"
#include "trc/trc1.h"

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <tuple>
#include <utility>

using namespace DPX;

// 日本語テキスト in UTF-16 and in three code pages.
static const std::u16string kJapanese = u"\u65E5\u672C\u8A9E\u30C6\u30AD\u30B9\u30C8";
static const std::string kShiftJis = "\x93\xFA\x96\x7B\x8C\xEA\x83\x65\x83\x4C\x83\x58\x83\x67";
static const std::string kEucJp = "\xC6\xFC\xCB\xDC\xB8\xEC\xA5\xC6\xA5\xAD\xA5\xB9\xA5\xC8";
static const std::string kUtf8 = "\xE6\x97\xA5\xE6\x9C\xAC\xE8\xAA\x9E\xE3\x83\x86\xE3\x82\xAD\xE3\x82\xB9\xE3\x83\x88";

using Locale = std::unique_ptr<CPG2_LOCALE, decltype(&CPG2_ReleaseLocale)>;

static Locale locale_of(uint32_t selector, int32_t codepage)
{
    return Locale(CPG2_GetLocale(selector, codepage, 0, nullptr), &CPG2_ReleaseLocale);
}

TEST(CodePage, InitializeReplaces943By932And33722By1208AndConvertsWholeTexts)
{
    // Code page, its trace of the switch, a text in the code page used and in UTF-16.
    const std::tuple<const char *, const char *, std::string, std::u16string> rows[] = {
        // 932 reads the byte 0x5C as a backslash, 943 as a yen sign.
        {"943", "codepage CPG2_CP943 detected, switching to CPG2_CP932", "\\" + kShiftJis, u"\\" + kJapanese},
        // Three bytes for every unit: the local form is longer than the text.
        {"33722", "codepage 33722 detected, switching to 1208", kUtf8, kJapanese},
        {"819", "", "caf\xE9", u"caf\u00E9"},
    };
    for (const auto &[codepage, switched, local, units] : rows) {
        dpxtest::TraceCapture trace(TRC1_FLOW | TRC1_ENTRY);
        dpxtest::ScopedEnv env("CPG2_CODEPAGE", codepage);
        EXPECT_TRUE(String::initialize());
        EXPECT_EQ(trace.count("switching"), *switched ? 1u : 0u) << codepage;
        EXPECT_TRUE(trace.contains(std::string("codepage=") + codepage + "\n") && trace.contains(switched) &&
                    trace.contains("initialize:") && trace.contains("EXIT result=1"))
            << trace.text();
        String text(local.c_str());
        EXPECT_EQ(std::u16string(text.getData(), text.getData() + text.length()), units) << codepage;
        EXPECT_EQ(std::string(text.c_str()), local) << codepage;
    }
    String::initialize();  // back to the process's own code page
}

TEST(CodePage, TheDefaultIsTheCodePageOfTheEnvironmentsLocale)
{
    dpxtest::ScopedEnv unset("CPG2_CODEPAGE", std::nullopt);
    const std::pair<const char *, int32_t> rows[] = {{"C.UTF-8", 1208}, {"C", 367}, {"xx_YY.NOWHERE", 367}};
    for (const auto &[name, codepage] : rows) {
        dpxtest::ScopedEnv lc_all("LC_ALL", name);
        EXPECT_EQ(CPG2_GetLocaleCodepageId(locale_of(CPG2_LOCALE_DEFAULT, 0).get(), nullptr), codepage) << name;
    }
}

TEST(CodePageLayer, EucJpAndShiftJisGoToUtf16AndBackUnchangedAndNothingIsWrittenPastADestination)
{
    for (const auto &[codepage, local] : {std::pair{33722, kEucJp}, std::pair{943, kShiftJis}}) {
        Locale locale = locale_of(CPG2_LOCALE_CODEPAGE, codepage);
        UChar units[16];
        char bytes[32];
        int32_t n = CPG2_toUTF16(locale.get(), local.data(), static_cast<int32_t>(local.size()), units, 16, nullptr);
        EXPECT_EQ(std::u16string(units, units + n), kJapanese) << codepage;
        n = CPG2_fromUTF16(locale.get(), units, n, bytes, sizeof bytes, nullptr);
        EXPECT_EQ(std::string(bytes, static_cast<size_t>(n)), local) << codepage;
    }
    const UChar japanese[] = {0x65E5, 0x672C, 0x8A9E};
    char bytes[8] = "#######";
    int32_t status = -1;
    // Nine bytes in UTF-8: the result tells them all, the destination holds four.
    EXPECT_EQ(CPG2_fromUTF16(locale_of(CPG2_LOCALE_CODEPAGE, 1208).get(), japanese, 3, bytes, 4, &status), 9);
    EXPECT_EQ(status, CPG2_E_OVERFLOW);
    EXPECT_STREQ(bytes + 4, "###");
}
