// Language selection: internal language numbers, country codes, the
// operating system's language and the C runtime locale guard.
#include "nxbase/language.h"

#include <algorithm>
#include <cctype>
#include <climits>
#include <clocale>
#include <iterator>
#include <string_view>

#include "nxbase/check.h"
#include "nxbase/configuration.h"
#include "nxbase/logfile.h"
#include "nxbase/strhelp.h"
#include "nxbase/text.h"
#include "text_os.h"
#include "toolkit/system.h"

namespace {

constexpr const char* kLogKey = "Language";
constexpr const char* kLocaleLogKey = "Locale";
constexpr const char* kSettingsGroup = "Settings";
constexpr const char* kLanguageKey = "language";
constexpr unsigned int kLangIdEnglishUS = 0x0409;

struct CountryEntry {
    int code;
    const char* shortName;
    const char* displayName;  // Windows-1252
    unsigned short language;
};

// Ordered by country code. The short names "cz" and "jp", 35 for Finnish,
// 42 for Czech, 87 for Simplified Chinese and 96 for Arabic are the
// library's own and stay as they are.
constexpr CountryEntry kCountries[] = {
    {1, "en", "English", Language::kEnglish},
    {7, "ru", "Russian", Language::kRussian},
    {30, "el", "Greek", Language::kGreek},
    {31, "nl", "Nederlands", Language::kDutch},
    {33, "fr",
     "Fran\xE7"
     "ais",
     Language::kFrench},
    {34, "es", "Espa\xF1ol", Language::kSpanish},
    {35, "fi", "Suomi", Language::kFinnish},
    {36, "hu", "Magyar", Language::kHungarian},
    {39, "it", "Italiano", Language::kItalian},
    {42, "cz", "Czech", Language::kCzech},
    {45, "da", "Danish", Language::kDanish},
    {46, "sv", "Svenska", Language::kSwedish},
    {47, "no", "Norwegian", Language::kNorwegian},
    {48, "pl", "Polish", Language::kPolish},
    {49, "de", "Deutsch", Language::kGerman},
    {55, "pt", "Portuguese", Language::kPortuguese},
    {81, "jp", "Japanese", Language::kJapanese},
    {84, "vi", "Vietnamese", Language::kVietnamese},
    {86, "zh", "Chinese (Traditional)", Language::kChineseTraditional},
    {87, "zh-CN", "Chinese (Simple)", Language::kChineseSimplified},
    {90, "tr", "Turkish", Language::kTurkish},
    {96, "ar", "Arabic", Language::kArabic},
    {359, "bg", "Bulgarian", Language::kBulgarian},
    {370, "lt", "Lithuanian", Language::kLithuanian},
    {421, "sk", "Slovakian", Language::kSlovak},
    {972, "he", "Hebrew", Language::kHebrew},
};

const CountryEntry* FindCountry(int code) {
    auto it = std::lower_bound(std::begin(kCountries), std::end(kCountries), code,
                               [](const CountryEntry& entry, int c) { return entry.code < c; });
    return it != std::end(kCountries) && it->code == code ? it : nullptr;
}

const CountryEntry* FindLanguage(unsigned short language) {
    for (const CountryEntry& entry : kCountries) {
        if (entry.language == language) return &entry;
    }
    return nullptr;
}

struct LangIdEntry {
    unsigned int langId;
    unsigned short language;
};

// Windows language identifiers with a language of their own; every other
// identifier means English.
constexpr LangIdEntry kLangIds[] = {
    {1025, Language::kArabic},
    {1026, Language::kBulgarian},
    {1028, Language::kChineseTraditional},
    {1029, Language::kCzech},
    {1030, Language::kDanish},
    {1031, Language::kGerman},
    {2055, Language::kGerman},
    {4103, Language::kGerman},
    {1032, Language::kGreek},
    {1034, Language::kSpanish},
    {2058, Language::kSpanish},
    {3082, Language::kSpanish},
    {1035, Language::kFinnish},
    {1036, Language::kFrench},
    {2060, Language::kFrench},
    {3084, Language::kFrench},
    {4108, Language::kFrench},
    {1037, Language::kHebrew},
    {1038, Language::kHungarian},
    {1040, Language::kItalian},
    {2064, Language::kItalian},
    {1041, Language::kJapanese},
    {1043, Language::kDutch},
    {2067, Language::kDutch},
    {1044, Language::kNorwegian},
    {2068, Language::kNorwegian},
    {1045, Language::kPolish},
    {1046, Language::kPortuguese},
    {2070, Language::kPortuguese},
    {1049, Language::kRussian},
    {1051, Language::kSlovak},
    {1053, Language::kSwedish},
    {1055, Language::kTurkish},
    {2052, Language::kChineseSimplified},
    {3081, Language::kEnglish},
    {4105, Language::kEnglish},
};

struct WinIniEntry {
    const char* name;
    unsigned short language;
};

constexpr WinIniEntry kWinIniNames[] = {
    {"deu", Language::kGerman},     {"enu", Language::kEnglish}, {"eng", Language::kEnglish},
    {"fra", Language::kFrench},     {"frc", Language::kFrench},  {"ita", Language::kItalian},
    {"esp", Language::kSpanish},    {"esn", Language::kSpanish}, {"dan", Language::kDanish},
    {"fin", Language::kFinnish},    {"nld", Language::kDutch},   {"nor", Language::kNorwegian},
    {"ptg", Language::kPortuguese}, {"sve", Language::kSwedish}, {"heb", Language::kHebrew},
};

// A POSIX language (and territory, "" for the language's main identifier)
// and the Windows identifier of that locale.
struct PosixEntry {
    const char* language;
    const char* territory;
    unsigned int langId;
};

// Languages whose territories Windows told apart list every territory it
// knew, so that each POSIX locale lands where the Windows one did; a
// territory missing here takes the language's main identifier.
constexpr PosixEntry kPosixLocales[] = {
    {"ar", "", 0x0401},
    {"bg", "", 0x0402},
    {"cs", "", 0x0405},
    {"da", "", 0x0406},
    {"el", "", 0x0408},
    {"en", "", 0x0409},
    {"fi", "", 0x040B},
    {"he", "", 0x040D},
    {"iw", "", 0x040D},
    {"hu", "", 0x040E},
    {"ja", "", 0x0411},
    {"pl", "", 0x0415},
    {"ru", "", 0x0419},
    {"sk", "", 0x041B},
    {"tr", "", 0x041F},
    {"lt", "", 0x0427},
    {"vi", "", 0x042A},
    {"nb", "", 0x0414},
    {"no", "", 0x0414},
    {"nn", "", 0x0814},
    // German.
    {"de", "", 0x0407},
    {"de", "DE", 0x0407},
    {"de", "CH", 0x0807},
    {"de", "AT", 0x0C07},
    {"de", "LU", 0x1007},
    {"de", "LI", 0x1407},
    // English: every territory is English.
    {"en", "US", 0x0409},
    {"en", "GB", 0x0809},
    {"en", "AU", 0x0C09},
    {"en", "CA", 0x1009},
    {"en", "NZ", 0x1409},
    {"en", "IE", 0x1809},
    // Spanish; "es_ES" is the modern sort.
    {"es", "", 0x0C0A},
    {"es", "ES", 0x0C0A},
    {"es", "MX", 0x080A},
    {"es", "GT", 0x100A},
    {"es", "CR", 0x140A},
    {"es", "PA", 0x180A},
    {"es", "DO", 0x1C0A},
    {"es", "VE", 0x200A},
    {"es", "CO", 0x240A},
    {"es", "PE", 0x280A},
    {"es", "AR", 0x2C0A},
    {"es", "EC", 0x300A},
    {"es", "CL", 0x340A},
    {"es", "UY", 0x380A},
    {"es", "PY", 0x3C0A},
    {"es", "BO", 0x400A},
    {"es", "SV", 0x440A},
    {"es", "HN", 0x480A},
    {"es", "NI", 0x4C0A},
    {"es", "PR", 0x500A},
    {"es", "US", 0x540A},
    // French.
    {"fr", "", 0x040C},
    {"fr", "FR", 0x040C},
    {"fr", "BE", 0x080C},
    {"fr", "CA", 0x0C0C},
    {"fr", "CH", 0x100C},
    {"fr", "LU", 0x140C},
    {"fr", "MC", 0x180C},
    {"fr", "RE", 0x200C},
    {"fr", "CD", 0x240C},
    {"fr", "SN", 0x280C},
    {"fr", "CM", 0x2C0C},
    {"fr", "CI", 0x300C},
    {"fr", "ML", 0x340C},
    {"fr", "MA", 0x380C},
    {"fr", "HT", 0x3C0C},
    // Italian, Dutch, Swedish, Portuguese.
    {"it", "", 0x0410},
    {"it", "IT", 0x0410},
    {"it", "CH", 0x0810},
    {"nl", "", 0x0413},
    {"nl", "NL", 0x0413},
    {"nl", "BE", 0x0813},
    {"sv", "", 0x041D},
    {"sv", "SE", 0x041D},
    {"sv", "FI", 0x081D},
    {"pt", "", 0x0816},
    {"pt", "PT", 0x0816},
    {"pt", "BR", 0x0416},
    // Chinese: a bare "zh" is taken as Simplified Chinese.
    {"zh", "", 0x0804},
    {"zh", "CN", 0x0804},
    {"zh", "TW", 0x0404},
    {"zh", "HK", 0x0C04},
    {"zh", "SG", 0x1004},
    {"zh", "MO", 0x1404},
};

std::string Lower(std::string_view text) {
    std::string result(text);
    for (char& c : result) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    return result;
}

std::string Upper(std::string_view text) {
    std::string result(text);
    for (char& c : result) c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
    return result;
}

std::string_view Trim(std::string_view text) {
    const char* blanks = " \t\r\n";
    std::size_t first = text.find_first_not_of(blanks);
    if (first == std::string_view::npos) return {};
    std::size_t last = text.find_last_not_of(blanks);
    return text.substr(first, last - first + 1);
}

void Log(const std::string& text, const char* key = kLogKey) {
    LogFile::WriteToLog(text, key);
}

}  // namespace

namespace nxbase {

unsigned short LanguageFromWindowsLangId(unsigned int alLangId) {
    for (const LangIdEntry& entry : kLangIds) {
        if (entry.langId == alLangId) return entry.language;
    }
    return Language::kEnglish;
}

unsigned short LanguageFromWinIniName(const std::string& asName) {
    for (const WinIniEntry& entry : kWinIniNames) {
        if (asName == entry.name) return entry.language;
    }
    return Language::kEnglish;
}

unsigned int WindowsLangIdFromPosixLocale(const std::string& asLocale) {
    // language[_territory][.codeset][@modifier]
    std::string_view name(asLocale);
    name = name.substr(0, name.find_first_of(".@"));
    const std::size_t underscore = name.find('_');
    const std::string language = Lower(name.substr(0, underscore));
    const std::string territory =
        underscore == std::string_view::npos ? std::string() : Upper(name.substr(underscore + 1));

    unsigned int primary = 0;
    for (const PosixEntry& entry : kPosixLocales) {
        if (language != entry.language) continue;
        if (territory == entry.territory) return entry.langId;
        if (*entry.territory == '\0') primary = entry.langId;
    }
    return primary != 0 ? primary : kLangIdEnglishUS;
}

unsigned short LanguageFromPosixLocale(const std::string& asLocale) {
    return LanguageFromWindowsLangId(WindowsLangIdFromPosixLocale(asLocale));
}

std::string PosixMessagesLocale() {
    for (const char* name : {"LC_ALL", "LC_MESSAGES", "LANG"}) {
        std::string value = detail::GetEnvironment(name);
        if (!value.empty()) return value;
    }
    return std::string();
}

std::string ReadWinIniLanguage(const std::string& asPath) {
    std::string bytes;
    if (!detail::ReadWholeFile(asPath, bytes)) return std::string();
    bool inIntl = false;
    std::size_t position = 0;
    while (position < bytes.size()) {
        std::size_t newline = bytes.find('\n', position);
        if (newline == std::string::npos) newline = bytes.size();
        std::string_view line = Trim(std::string_view(bytes).substr(position, newline - position));
        position = newline + 1;
        if (line.empty() || line.front() == ';') continue;
        if (line.front() == '[') {
            std::size_t close = line.find(']');
            inIntl =
                close != std::string_view::npos && Lower(Trim(line.substr(1, close - 1))) == "intl";
            continue;
        }
        if (!inIntl) continue;
        std::size_t equals = line.find('=');
        if (equals == std::string_view::npos) continue;
        if (Lower(Trim(line.substr(0, equals))) == "slanguage") {
            return std::string(Trim(line.substr(equals + 1)));
        }
    }
    return std::string();
}

}  // namespace nxbase

// ---------------------------------------------------------------------------

FileLanguageAccessChecker::FileLanguageAccessChecker(const String& asBasePath)
    : amBasePath(toolkit::NormalizePath(asBasePath.str())) {}

bool FileLanguageAccessChecker::IsAccessible(LanguageCode axCode) const {
    return nxbase::detail::IsReadableFile(amBasePath.str() +
                                          std::to_string(static_cast<int>(axCode)) + ".lng");
}

std::unique_ptr<LanguageAccessChecker> FileLanguageAccessChecker::Clone() const {
    return std::make_unique<FileLanguageAccessChecker>(*this);
}

// ---------------------------------------------------------------------------

Language* Language::smInstance = nullptr;

Language* Language::CreateLanguage(ConfigInterface* pConfig, String& asTextBase) {
    FileLanguageAccessChecker checker(String(nxbase::detail::TextFilePrefix(asTextBase)));
    return CreateLanguage(pConfig, checker);
}

Language* Language::CreateLanguage(ConfigInterface* pConfig,
                                   const LanguageAccessChecker& axChecker) {
    std::unique_ptr<LanguageAccessChecker> checker = axChecker.Clone();
    nxbase::InstallSingleton<Language>(smInstance, nullptr);
    return nxbase::InstallSingleton(smInstance, new Language(pConfig, std::move(checker)));
}

Language* Language::Instance() {
    return nxbase::StrictSingletonInstance(smInstance,
                                           "Please create the Language-Singleton first !");
}

bool Language::IsInitialized() {
    return smInstance != nullptr;
}

Language::Language(ConfigInterface* pConfigArg, std::unique_ptr<LanguageAccessChecker> pCheckerArg)
    : NxSingleton("Language"), pConfig(pConfigArg), pChecker(std::move(pCheckerArg)) {
    std::string stored;
    if (pConfig != nullptr) stored = pConfig->ReadKey(kSettingsGroup, kLanguageKey, "");
    long long code = 0;
    unsigned short language = kEnglish;
    if (StringHelpers::ParseInteger(Trim(stored), code) && code >= INT_MIN && code <= INT_MAX &&
        CountryCodeToLanguage(static_cast<LanguageCode>(code), language)) {
        amLanguage = language;
        Log("Language from configuration: " + std::to_string(code));
    } else {
        amLanguage = GetSystemLanguage();
        Log("Language from system: " + std::to_string(static_cast<int>(GetCountryCode())));
    }
}

Language::~Language() {
    if (smInstance == this) smInstance = nullptr;
}

LanguageCode Language::GetCountryCode() const {
    return LanguageToCountryCode(amLanguage);
}

std::string Language::GetShortLanguageName() const {
    return CountryCodeToShortLanguageName(GetCountryCode());
}

void Language::SetLanguage(unsigned short alLanguage) {
    if (FindLanguage(alLanguage) == nullptr) {
        Log("Unknown language number: " + std::to_string(alLanguage));
        return;
    }
    amLanguage = alLanguage;
    Store();
}

void Language::SetLanguageByCountryCode(LanguageCode axCode) {
    unsigned short language = kEnglish;
    if (!CountryCodeToLanguage(axCode, language)) {
        Log("Unknown country code: " + std::to_string(static_cast<int>(axCode)));
        return;
    }
    amLanguage = language;
    Store();
}

void Language::Store() const {
    if (pConfig == nullptr) return;
    pConfig->WriteKey(kSettingsGroup, kLanguageKey,
                      std::to_string(static_cast<int>(GetCountryCode())));
}

std::vector<LanguageCode> Language::GetAccessibleLanguages() const {
    std::vector<LanguageCode> codes;
    for (const CountryEntry& entry : kCountries) {
        const auto code = static_cast<LanguageCode>(entry.code);
        if (!pChecker || pChecker->IsAccessible(code)) codes.push_back(code);
    }
    return codes;
}

void Language::InitListBox(std::vector<String>& axList, std::vector<LanguageCode>* pCodes) const {
    std::vector<LanguageCode> codes = GetAccessibleLanguages();
    axList.clear();
    for (LanguageCode code : codes) axList.emplace_back(CountryCodeToDisplayName(code));
    if (pCodes != nullptr) *pCodes = std::move(codes);
}

std::string Language::CountryCodeToShortLanguageName(LanguageCode axCode) {
    const CountryEntry* entry = FindCountry(axCode);
    return entry != nullptr ? entry->shortName : "";
}

LanguageCode Language::ShortLanguageNameToCountryCode(const std::string&) {
    NX_ERROR("Not yet implemented");
    return static_cast<LanguageCode>(0);
}

std::string Language::CountryCodeToDisplayName(LanguageCode axCode) {
    const CountryEntry* entry = FindCountry(axCode);
    return entry != nullptr ? entry->displayName : "";
}

LanguageCode Language::LanguageToCountryCode(unsigned short alLanguage) {
    const CountryEntry* entry = FindLanguage(alLanguage);
    return static_cast<LanguageCode>(entry != nullptr ? entry->code : 0);
}

bool Language::CountryCodeToLanguage(LanguageCode axCode, unsigned short& alLanguage) {
    const CountryEntry* entry = FindCountry(axCode);
    if (entry == nullptr) return false;
    alLanguage = entry->language;
    return true;
}

unsigned short Language::GetSystemLanguage() {
    const std::string windir = nxbase::detail::GetEnvironment("windir");
    if (!windir.empty()) {
        const std::string winIni = toolkit::NormalizePath(windir + "\\win.ini");
        if (nxbase::detail::IsReadableFile(winIni)) {
            const std::string name = nxbase::ReadWinIniLanguage(winIni);
            Log("System language from " + winIni + ": " + name);
            return nxbase::LanguageFromWinIniName(name);
        }
    }
    const std::string locale = nxbase::PosixMessagesLocale();
    Log("System locale: " + locale);
    return nxbase::LanguageFromPosixLocale(locale);
}

// ---------------------------------------------------------------------------

LocaleSetter::LocaleSetter(int axCategory, const std::string& asLocale)
    : amCategory(axCategory), amOriginal(nxbase::detail::QueryCLocale(axCategory)) {
    Log("Original locale: " + amOriginal, kLocaleLogKey);
    const std::string name = asLocale == ".ACP" ? std::string("C") : asLocale;
    Log("Temporary locale: " + nxbase::detail::SetCLocale(amCategory, name), kLocaleLogKey);
}

LocaleSetter::~LocaleSetter() {
    if (!amOriginal.empty()) nxbase::detail::SetCLocale(amCategory, amOriginal);
    Log("Restored locale: " + amOriginal, kLocaleLogKey);
}
