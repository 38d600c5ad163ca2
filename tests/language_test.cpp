#include "nxbase/language.h"

#include <gtest/gtest.h>

#include <boost/make_shared.hpp>
#include <clocale>
#include <regex>
#include <stdexcept>
#include <string>
#include <vector>

#include "nxbase/configuration.h"
#include "nxbase/logfile.h"
#include "nxbase/singleton.h"
#include "test_util.h"
#include "toolkit/userinterface.h"

namespace {

class LanguageTest : public ::testing::Test {
  protected:
    void TearDown() override { NxSingleton::DeleteAllSingleton(); }

    nxtest::TempDir dir;
    nxtest::ScopedEnv logPath{"NXBASE_LOG_PATH", dir.path().string()};
    // The system language is whatever these say, unless a test changes them.
    nxtest::ScopedEnv lcAll{"LC_ALL", ""};
    nxtest::ScopedEnv lcMessages{"LC_MESSAGES", ""};
    nxtest::ScopedEnv lang{"LANG", "de_CH.UTF-8"};
    nxtest::ScopedEnv windir{"windir", ""};
};

// Offers every language.
class OfferAll : public LanguageAccessChecker {
  public:
    bool IsAccessible(LanguageCode) const override { return true; }
    std::unique_ptr<LanguageAccessChecker> Clone() const override {
        return std::make_unique<OfferAll>();
    }
};

TEST(LanguageTable, CountryCodesKeepTheirShortNamesAndLanguages) {
    const std::pair<int, const char*> shortNames[] = {{2, ""},
                                                      {0, ""},
                                                      {kLanguageChineseSimplified, "zh-CN"},
                                                      {kLanguageChineseTraditional, "zh"},
                                                      {42, "cz"},
                                                      {81, "jp"},
                                                      {35, "fi"},
                                                      {96, "ar"},
                                                      {972, "he"}};
    for (const auto& [code, name] : shortNames) {
        EXPECT_EQ(Language::CountryCodeToShortLanguageName(static_cast<LanguageCode>(code)), name)
            << code;
    }
    EXPECT_EQ(Language::CountryCodeToDisplayName(kLanguageFrench),
              "Fran\xE7"
              "ais");
    EXPECT_EQ(Language::CountryCodeToDisplayName(kLanguageSpanish), "Espa\xF1ol");

    // Every listed code has one internal number and comes back from it.
    const int codes[] = {1,  7,  30, 31, 33, 34, 35, 36, 39, 42,  45,  46,  47,
                         48, 49, 55, 81, 84, 86, 87, 90, 96, 359, 370, 421, 972};
    for (int code : codes) {
        unsigned short language = 999;
        ASSERT_TRUE(Language::CountryCodeToLanguage(static_cast<LanguageCode>(code), language))
            << code;
        EXPECT_EQ(Language::LanguageToCountryCode(language), code);
    }
    unsigned short unused = 0;
    EXPECT_FALSE(Language::CountryCodeToLanguage(static_cast<LanguageCode>(44), unused));
    EXPECT_EQ(Language::LanguageToCountryCode(Language::kGerman), kLanguageGerman);
    EXPECT_EQ(Language::LanguageToCountryCode(21), 0) << "21 has no language";
}

TEST(LanguageTable, WindowsIdentifiersAndWinIniNamesMapToInternalNumbers) {
    // 3079 (Austria) is not listed; WIN.INI names are lower case.
    const std::pair<int, int> windowsIds[] = {{1031, Language::kGerman},
                                              {2055, Language::kGerman},
                                              {4103, Language::kGerman},
                                              {3079, Language::kEnglish},
                                              {1028, Language::kChineseTraditional},
                                              {2052, Language::kChineseSimplified},
                                              {1041, Language::kJapanese},
                                              {1051, Language::kSlovak},
                                              {1037, Language::kHebrew},
                                              {3082, Language::kSpanish},
                                              {4108, Language::kFrench},
                                              {2070, Language::kPortuguese},
                                              {1025, Language::kArabic},
                                              {1033, Language::kEnglish},
                                              {0xFFFF, Language::kEnglish}};
    for (const auto& [id, language] : windowsIds) {
        EXPECT_EQ(nxbase::LanguageFromWindowsLangId(id), language) << id;
    }
    const std::pair<const char*, int> winIniNames[] = {
        {"deu", Language::kGerman},     {"frc", Language::kFrench}, {"esn", Language::kSpanish},
        {"ptg", Language::kPortuguese}, {"heb", Language::kHebrew}, {"DEU", Language::kEnglish},
        {"jpn", Language::kEnglish}};
    for (const auto& [name, language] : winIniNames) {
        EXPECT_EQ(nxbase::LanguageFromWinIniName(name), language) << name;
    }
}

TEST(LanguageTable, PosixLocalesLandWhereTheWindowsIdentifiersDid) {
    using nxbase::LanguageFromPosixLocale;
    EXPECT_EQ(nxbase::WindowsLangIdFromPosixLocale("de_CH.UTF-8"), 2055u);
    // de_BE: a territory Windows lacked takes the language's main identifier.
    const std::pair<const char*, int> locales[] = {{"de_CH.UTF-8", Language::kGerman},
                                                   {"de_DE@euro", Language::kGerman},
                                                   {"de_BE.UTF-8", Language::kGerman},
                                                   {"de_AT.UTF-8", Language::kEnglish},
                                                   {"fr_FR.ISO-8859-1", Language::kFrench},
                                                   {"fr_CA", Language::kFrench},
                                                   {"fr_LU", Language::kEnglish},
                                                   {"zh_CN.GB18030", Language::kChineseSimplified},
                                                   {"zh_TW.UTF-8", Language::kChineseTraditional},
                                                   {"ja_JP.eucJP", Language::kJapanese},
                                                   {"es_AR", Language::kEnglish},
                                                   {"es_ES", Language::kSpanish},
                                                   {"pt_BR.UTF-8", Language::kPortuguese},
                                                   {"nn_NO", Language::kNorwegian},
                                                   {"ru_UA.UTF-8", Language::kRussian},
                                                   {"sk_SK", Language::kSlovak}};
    for (const auto& [locale, language] : locales) {
        EXPECT_EQ(LanguageFromPosixLocale(locale), language) << locale;
    }
    for (const char* neutral : {"C", "POSIX", "C.UTF-8", "", "ko_KR.UTF-8", "_", "@"}) {
        EXPECT_EQ(LanguageFromPosixLocale(neutral), Language::kEnglish) << neutral;
    }
}

TEST_F(LanguageTest, SystemLanguageComesFromTheLocaleVariablesOrWinIni) {
    EXPECT_EQ(Language::GetSystemLanguage(), Language::kGerman);
    {
        nxtest::ScopedEnv messages("LC_MESSAGES", "ja_JP.UTF-8");
        EXPECT_EQ(Language::GetSystemLanguage(), Language::kJapanese);
        nxtest::ScopedEnv all("LC_ALL", "zh_CN.UTF-8");
        EXPECT_EQ(Language::GetSystemLanguage(), Language::kChineseSimplified);
    }
    {
        nxtest::ScopedEnv posix("LANG", "POSIX");
        EXPECT_EQ(Language::GetSystemLanguage(), Language::kEnglish);
    }

    nxtest::WriteFile(dir.File("win.ini"),
                      "[fonts]\r\nsLanguage=deu\r\n[Intl]\r\n; comment\r\n  SLANGUAGE = fra \r\n");
    EXPECT_EQ(nxbase::ReadWinIniLanguage(dir.File("win.ini")), "fra");
    {
        nxtest::ScopedEnv windows("windir", dir.path().string());
        EXPECT_EQ(Language::GetSystemLanguage(), Language::kFrench);
    }
    {
        nxtest::ScopedEnv nothingThere("windir", dir.File("nowhere"));
        EXPECT_EQ(Language::GetSystemLanguage(), Language::kGerman);
    }
}

TEST_F(LanguageTest, ChoiceIsStoredAsCountryCodeAndReadBack) {
    EXPECT_THROW(Language::Instance(), std::logic_error) << "before creation";
    MemoryConfig config;
    Language* language = Language::CreateLanguage(&config, OfferAll());
    EXPECT_EQ(language->GetCountryCode(), kLanguageGerman) << "from LANG";
    EXPECT_EQ(config.ReadKey("Settings", "language", "none"), "none")
        << "creating reads, it does not write";

    language->SetLanguage(Language::kChineseSimplified);
    EXPECT_TRUE(language->IsChinese());
    EXPECT_EQ(language->GetShortLanguageName(), "zh-CN");
    EXPECT_EQ(config.ReadKey("Settings", "language", ""), "87");

    language->SetLanguageByCountryCode(kLanguageJapanese);
    EXPECT_TRUE(language->IsJapanese());
    EXPECT_EQ(config.ReadKey("Settings", "language", ""), "81");

    language->SetLanguage(21);
    language->SetLanguageByCountryCode(static_cast<LanguageCode>(44));
    EXPECT_EQ(language->GetCountryCode(), kLanguageJapanese) << "unknown choices are ignored";
    EXPECT_EQ(config.ReadKey("Settings", "language", ""), "81");

    // A new singleton over the same store starts where the old one stopped.
    Language* second = Language::CreateLanguage(&config, OfferAll());
    EXPECT_TRUE(second->IsJapanese());

    config.WriteKey("Settings", "language", "49x");
    EXPECT_EQ(Language::CreateLanguage(&config, OfferAll())->GetCountryCode(), kLanguageGerman);
    config.WriteKey("Settings", "language", "7");
    EXPECT_EQ(Language::CreateLanguage(&config, OfferAll())->GetCountryCode(), kLanguageRussian);
    EXPECT_EQ(Language::CreateLanguage(nullptr, OfferAll())->GetCountryCode(), kLanguageGerman);
}

TEST_F(LanguageTest, ChoicePersistsInAnIniFile) {
    const std::string path = dir.File("user.ini");
    {
        IniConfig config(path);
        Language::CreateLanguage(&config, OfferAll())->SetLanguageByCountryCode(kLanguageFrench);
    }
    NxSingleton::DeleteAllSingleton();
    EXPECT_TRUE(std::regex_search(nxtest::ReadFile(path),
                                  std::regex(R"(\[Settings\]\r?\nlanguage *= *33\r?\n)")))
        << nxtest::ReadFile(path);
    IniConfig reopened(path);
    EXPECT_EQ(Language::CreateLanguage(&reopened, OfferAll())->GetCountryCode(), kLanguageFrench);
}

TEST_F(LanguageTest, ListBoxOffersLanguagesWithTextFiles) {
    for (const char* name : {"Texte1.lng", "Texte49.lng", "Texte33.lng", "Other81.lng"}) {
        nxtest::WriteFile(dir.File(name), "{G}\n");
    }
    String base(dir.File("Texte"));
    Language* language = Language::CreateLanguage(nullptr, base);

    std::vector<String> names{"stale entry"};
    std::vector<LanguageCode> codes;
    language->InitListBox(names, &codes);
    ASSERT_EQ(names.size(), 3u);
    EXPECT_EQ(names[0].str(), "English");
    EXPECT_EQ(names[1].str(),
              "Fran\xE7"
              "ais");
    EXPECT_EQ(names[2].str(), "Deutsch");
    EXPECT_EQ(codes,
              (std::vector<LanguageCode>{kLanguageEnglish, kLanguageFrench, kLanguageGerman}));

    FileLanguageAccessChecker checker(String(dir.File("Other")));
    EXPECT_TRUE(checker.IsAccessible(kLanguageJapanese));
    EXPECT_FALSE(checker.IsAccessible(kLanguageEnglish));
}

TEST_F(LanguageTest, ShortNameToCodeReportsNotImplemented) {
    auto ui = std::make_shared<RecordingUserInterface>(false);
    ScopedUserInterface scoped(ui);
    EXPECT_EQ(Language::ShortLanguageNameToCountryCode("de"), 0);
    ASSERT_EQ(ui->Boxes().size(), 1u);
    EXPECT_THAT(ui->Boxes()[0].text, HasSubstr("Not yet implemented"));
}

TEST_F(LanguageTest, LocaleSetterRestoresTheCategory) {
    const std::string before = std::setlocale(LC_CTYPE, nullptr);
    ASSERT_NE(std::setlocale(LC_CTYPE, "C.UTF-8"), nullptr);
    {
        LocaleSetter ansi(LC_CTYPE, ".ACP");
        EXPECT_STREQ(std::setlocale(LC_CTYPE, nullptr), "C");
        LocaleSetter refused(LC_CTYPE, "xx_NOWHERE.none");
        EXPECT_STREQ(std::setlocale(LC_CTYPE, nullptr), "C") << "a refused name changes nothing";
    }
    EXPECT_STREQ(std::setlocale(LC_CTYPE, nullptr), "C.UTF-8");
    std::setlocale(LC_CTYPE, before.c_str());
}

}  // namespace
