// Language knows which user-interface language is in force: it keeps an
// internal language number, converts it to and from a telephone-style
// country code (LanguageCode) and a short name, lists the languages that
// may be offered, and persists the choice in a configuration. It is a
// singleton without a lock: create it at start-up on one thread, read it
// from any thread afterwards. LocaleSetter changes a C runtime locale
// category for the lifetime of one object (process-wide state).
#ifndef NXBASE_LANGUAGE_H_
#define NXBASE_LANGUAGE_H_

#include <memory>
#include <string>
#include <vector>

#include "nxbase/export.h"
#include "nxbase/singleton.h"
#include "toolkit/string.h"

class Configuration;
// The configuration back-end Language reads and writes its choice through.
using ConfigInterface = Configuration;

// Languages by telephone-style country code. Codes without a name here are
// valid values too (they simply have no short name).
enum LanguageCode : int {
    kLanguageEnglish = 1,
    kLanguageRussian = 7,
    kLanguageGreek = 30,
    kLanguageDutch = 31,
    kLanguageFrench = 33,
    kLanguageSpanish = 34,
    kLanguageFinnish = 35,
    kLanguageHungarian = 36,
    kLanguageItalian = 39,
    kLanguageCzech = 42,
    kLanguageDanish = 45,
    kLanguageSwedish = 46,
    kLanguageNorwegian = 47,
    kLanguagePolish = 48,
    kLanguageGerman = 49,
    kLanguagePortuguese = 55,
    kLanguageJapanese = 81,
    kLanguageVietnamese = 84,
    kLanguageChineseTraditional = 86,
    kLanguageChineseSimplified = 87,
    kLanguageTurkish = 90,
    kLanguageArabic = 96,
    kLanguageBulgarian = 359,
    kLanguageLithuanian = 370,
    kLanguageSlovak = 421,
    kLanguageHebrew = 972,
};

// Decides which languages may be offered to the user; an access policy the
// application passes to Language::CreateLanguage.
class NXBASE_EXPORT LanguageAccessChecker {
  public:
    virtual ~LanguageAccessChecker() = default;
    // True when the language may be offered.
    virtual bool IsAccessible(LanguageCode axCode) const = 0;
    // A copy owned by the caller (Language keeps its own).
    virtual std::unique_ptr<LanguageAccessChecker> Clone() const = 0;
};

// Offers a language when its text file <base path><code>.lng is readable,
// for example "/opt/app/LNG/Texte" offers German when Texte49.lng exists.
class NXBASE_EXPORT FileLanguageAccessChecker : public LanguageAccessChecker {
  public:
    explicit FileLanguageAccessChecker(const String& asBasePath);
    bool IsAccessible(LanguageCode axCode) const override;
    std::unique_ptr<LanguageAccessChecker> Clone() const override;
    const String& GetBasePath() const { return amBasePath; }

  private:
    String amBasePath;
};

class NXBASE_EXPORT Language : public NxSingleton {
  public:
    // Internal language numbers.
    enum : unsigned short {
        kEnglish = 0,
        kGerman = 1,
        kSpanish = 2,
        kFrench = 3,
        kItalian = 4,
        kDutch = 5,
        kSwedish = 6,
        kFinnish = 7,
        kNorwegian = 8,
        kDanish = 9,
        kPortuguese = 10,
        kCzech = 11,
        kHungarian = 12,
        kPolish = 13,
        kArabic = 14,
        kRussian = 15,
        kLithuanian = 16,
        kTurkish = 17,
        kGreek = 18,
        kBulgarian = 19,
        kVietnamese = 20,
        kChineseSimplified = 22,
        kChineseTraditional = 23,
        kJapanese = 24,
        kSlovak = 30,
        kHebrew = 33,
    };

    // Creates (or replaces) the singleton over `pConfig`, which the caller
    // keeps alive while the singleton uses it (null: nothing is read or
    // stored). The language is the one stored under "Settings"/"language"
    // (a country code), else the operating system's. The first form offers
    // the languages whose text files <asTextBase><code>.lng exist; a base
    // without a directory part is looked up in the application's language
    // directory.
    static Language* CreateLanguage(ConfigInterface* pConfig, String& asTextBase);
    static Language* CreateLanguage(ConfigInterface* pConfig,
                                    const LanguageAccessChecker& axChecker);
    // The singleton; std::logic_error "Please create the Language-Singleton
    // first !" when none was created.
    static Language* Instance();
    static bool IsInitialized();

    ~Language() override;
    Language(const Language&) = delete;
    Language& operator=(const Language&) = delete;

    // The internal number of the current language.
    unsigned short GetLanguage() const { return amLanguage; }
    LanguageCode GetCountryCode() const;
    std::string GetShortLanguageName() const;
    bool IsJapanese() const { return amLanguage == kJapanese; }
    bool IsChinese() const {
        return amLanguage == kChineseSimplified || amLanguage == kChineseTraditional;
    }

    // Make the language current and store its country code under
    // "Settings"/"language". A number or code with no language is logged
    // and ignored.
    void SetLanguage(unsigned short alLanguage);
    void SetLanguageByCountryCode(LanguageCode axCode);

    // Replaces the list's entries by the display names of the languages the
    // checker allows, in the order of their country codes; `pCodes`, when
    // given, receives the matching codes.
    void InitListBox(std::vector<String>& axList,
                     std::vector<LanguageCode>* pCodes = nullptr) const;
    // The country codes the checker allows, ascending.
    std::vector<LanguageCode> GetAccessibleLanguages() const;

    // The short name ("de", "zh-CN", deliberately "cz" and "jp"), "" for an
    // unknown code.
    static std::string CountryCodeToShortLanguageName(LanguageCode axCode);
    // Not implemented: reports "Not yet implemented" and returns 0.
    static LanguageCode ShortLanguageNameToCountryCode(const std::string& asName);
    // The display name in the ANSI code page ("Fran\xE7" "ais"), "" if unknown.
    static std::string CountryCodeToDisplayName(LanguageCode axCode);
    // Country code of an internal number, 0 when the number has no language.
    static LanguageCode LanguageToCountryCode(unsigned short alLanguage);
    // Internal number of a country code; false when the code is not listed.
    static bool CountryCodeToLanguage(LanguageCode axCode, unsigned short& alLanguage);

    // The operating system's language as an internal number: the win.ini
    // entry when $windir names a readable win.ini, else the POSIX locale of
    // LC_ALL, LC_MESSAGES or LANG; English when neither tells.
    static unsigned short GetSystemLanguage();

  private:
    Language(ConfigInterface* pConfig, std::unique_ptr<LanguageAccessChecker> pChecker);
    void Store() const;

    ConfigInterface* pConfig = nullptr;
    std::unique_ptr<LanguageAccessChecker> pChecker;
    unsigned short amLanguage = kEnglish;

    static Language* smInstance;
};

namespace nxbase {

// Internal language number of a Windows language identifier (LANGID);
// English for every identifier without a language of its own.
NXBASE_EXPORT unsigned short LanguageFromWindowsLangId(unsigned int alLangId);

// Internal language number of the three-letter "sLanguage" value of the
// "intl" section of win.ini ("deu", "fra", ...); English when unknown.
NXBASE_EXPORT unsigned short LanguageFromWinIniName(const std::string& asName);

// The Windows language identifier of a POSIX locale name such as
// "de_CH.UTF-8" or "fr_FR@euro": the identifier of that language and
// territory, the language's primary identifier when the territory has none,
// and 0x0409 (English, United States) for "C", "POSIX" and unknown names.
NXBASE_EXPORT unsigned int WindowsLangIdFromPosixLocale(const std::string& asLocale);

// Internal language number of a POSIX locale name, through its LANGID.
NXBASE_EXPORT unsigned short LanguageFromPosixLocale(const std::string& asLocale);

// The first non-empty of LC_ALL, LC_MESSAGES and LANG, "" when all are unset.
NXBASE_EXPORT std::string PosixMessagesLocale();

// Reads "sLanguage" of section "intl" from the win.ini file at `asPath`
// (names compared without case, as Windows does); "" when absent.
NXBASE_EXPORT std::string ReadWinIniLanguage(const std::string& asPath);

}  // namespace nxbase

// Sets a C runtime locale category for the lifetime of the object and
// restores the previous locale afterwards, logging each step under "Locale".
// ".ACP" (the Windows ANSI code page) stands for the "C" locale here: Linux
// has no Windows-1252 locale, and bytes are classified as plain ASCII.
class NXBASE_EXPORT LocaleSetter {
  public:
    LocaleSetter(int axCategory, const std::string& asLocale);
    ~LocaleSetter();
    LocaleSetter(const LocaleSetter&) = delete;
    LocaleSetter& operator=(const LocaleSetter&) = delete;

  private:
    int amCategory;
    std::string amOriginal;
};

#endif  // NXBASE_LANGUAGE_H_
