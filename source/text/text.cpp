// Text files and text groups: the process-wide text table, its parser and
// the two error reporters.
#include "nxbase/text.h"

#include <boost/regex.hpp>
#include <clocale>
#include <cstring>
#include <map>
#include <vector>

#include "nxbase/appconfig.h"
#include "nxbase/files.h"
#include "nxbase/language.h"
#include "nxbase/logfile.h"
#include "text_os.h"
#include "toolkit/direntry.h"
#include "toolkit/string.h"
#include "toolkit/system.h"
#include "toolkit/userinterface.h"

namespace {

constexpr const char* kLogKey = "Language";
constexpr const char* kLineLogKey = "Language2";
constexpr const char* kLngExtension = ".lng";
// Windows text mode ends a file at the first Ctrl-Z.
constexpr char kEndOfFileMark = '\x1A';
constexpr int kGermanLanguage = 49;

// The line expressions of the file format, used exactly as written (Perl
// syntax). Outside a bracket expression "[:space:]" is the set of the
// characters ":space", so blanks after the closing brace do not match.
const char* const kGroupExpression = R"([[:space:]|[:digit:]]*\{(.*)\}[:space:]*\z)";
const char* const kTextExpression = R"([[:space:]|[:digit:]]*\[(.*)\][:space:]*\z)";
// Defined for a code-page line; the parser does not act on it.
[[maybe_unused]] const char* const kCodePageExpression =
    R"([[:space:]|[:digit:]]*CodePage=(.*)[:space:]*\z)";

using TextTable = std::map<std::string, std::vector<std::string>, std::less<>>;

struct TextStore {
    TextTable table;
    int language = Text::kFallbackLanguage;
};

TextStore& Store() {
    static TextStore store;
    return store;
}

const boost::regex& GroupExpression() {
    static const boost::regex expression(kGroupExpression, boost::regex::perl);
    return expression;
}

const boost::regex& TextExpression() {
    static const boost::regex expression(kTextExpression, boost::regex::perl);
    return expression;
}

void Log(const std::string& text, const char* key = kLogKey) {
    LogFile::WriteToLog(text, key);
}

std::string Quoted(const std::string& text) {
    return "\"" + text + "\"";
}

using LineMatch = boost::match_results<std::string_view::const_iterator>;

// Matches `line` against `expression` over the whole line and stores
// capture 1 in `capture`; `match` is scratch space reused between lines. A
// match that exceeds Boost's complexity bound counts as no match.
bool MatchLine(std::string_view line, const boost::regex& expression, LineMatch& match,
               std::string& capture) {
    try {
        if (!boost::regex_match(line.begin(), line.end(), match, expression)) return false;
    } catch (const std::runtime_error&) {
        return false;
    }
    capture.assign(match[1].first, match[1].second);
    return true;
}

bool HasEncodingMarker(std::string_view line) {
    return line.find("Encoding=UTF-8") != std::string_view::npos ||
           line.find("Encoding=UTF8") != std::string_view::npos;
}

// The text file of `base` and `language`: <prefix><language>.lng.
std::string TextFileName(const String& base, int language) {
    return nxbase::detail::TextFilePrefix(base) + std::to_string(language) + kLngExtension;
}

}  // namespace

namespace nxbase::detail {

std::string TextFilePrefix(const String& base) {
    if (base.str().find_first_of("/\\") != std::string::npos) {
        return toolkit::NormalizePath(base.str());
    }
    if (!AppDir::IsInitialized()) return base.str();
    return (AppDir::Instance()->LngDirEntry() + DirEntry(base)).GetFull().str();
}

std::string Utf8ToAnsi(std::string_view utf8) {
    return Utf8ToWindows1252(utf8);
}

std::string AnsiToUtf8(std::string_view ansi) {
    return toolkit::Windows1252ToUtf8(ansi);
}

void ParseTextBytes(std::string_view bytes, const std::string& fileName) {
    Log("Parse text file: " + Quoted(fileName));
    LocaleSetter ctype(LC_CTYPE, ".ACP");

    const std::size_t end = bytes.find(kEndOfFileMark);
    if (end != std::string_view::npos) bytes = bytes.substr(0, end);

    const bool logLines = LogFile::Instance()->IsLogOptionEnabled(kLineLogKey);
    TextTable& table = Store().table;
    std::string currentGroup;
    // The texts of the current group once it holds one.
    std::vector<std::string>* currentTexts = nullptr;
    LineMatch match;
    bool utf8 = false;
    std::string capture;

    std::size_t position = 0;
    while (position < bytes.size()) {
        std::size_t newline = bytes.find('\n', position);
        std::size_t next = newline == std::string_view::npos ? bytes.size() : newline + 1;
        std::string_view line = bytes.substr(position, next - position);
        position = next;
        if (newline != std::string_view::npos) {
            line.remove_suffix(1);
            // Text mode turned CR LF into LF.
            if (!line.empty() && line.back() == '\r') line.remove_suffix(1);
        }

        // The marker counts wherever no group is open: before the first
        // group line, and after a group line that reopened nothing.
        if (currentGroup.empty() && !utf8 && HasEncodingMarker(line)) utf8 = true;
        if (logLines) Log(" Read line: " + std::string(line), kLineLogKey);

        // Each expression needs its opening bracket: lines without one are
        // skipped before the regular expressions run.
        if (line.find('{') != std::string_view::npos &&
            MatchLine(line, GroupExpression(), match, capture)) {
            currentGroup.clear();
            currentTexts = nullptr;
            if (table.find(capture) == table.end()) {
                currentGroup = capture;
            }
        } else if (line.find('[') != std::string_view::npos &&
                   MatchLine(line, TextExpression(), match, capture)) {
            if (currentGroup.empty()) continue;
            if (currentTexts == nullptr) currentTexts = &table[currentGroup];
            currentTexts->push_back(utf8 ? Utf8ToWindows1252(capture) : capture);
        }
    }
}

std::string SyntaxErrorMessage(int language, const std::string& fileName, char missing,
                               const std::string& group) {
    const std::string character(1, missing);
    if (language == kGermanLanguage) {
        return "Fehler in Textdatei '" + fileName + "'\nFehlendes Zeichen '" + character +
               "' in Textgruppe '" + group + "'\n\nweiterfahren?";
    }
    return "error in text file '" + fileName + "'\n'" + character + "' missing in text group '" +
           group + "'\n\ncontinue?";
}

std::string LoadErrorMessage(int language, const std::string& fileName, int code) {
    const bool german = language == kGermanLanguage;
    std::string message = german ? "Fehler in Textdatei '" : "error in text file '";
    message += fileName + "'\n";
    const std::string limit = std::to_string(Text::kMaxTextGroups);
    switch (code) {
        case 1:
            // "ö" in Windows-1252.
            message += german ? "Es ist nicht m\xF6glich die Textdatei zu \xF6"
                                "ffnen"
                              : "unable to open text file";
            break;
        case 2:
            message += german ? "Mehr als " + limit + " Textgruppen"
                              : "more then " + limit + " text groups";
            break;
        default:
            message += german ? "Allgemeiner Fehler" : "general error";
            break;
    }
    return message;
}

}  // namespace nxbase::detail

bool Text::LoadLibraryTexts(int alLanguage) {
    const std::string directory = nxbase::LibraryDataDirectory();
    if (directory.empty()) return false;
    const std::string prefix = directory + "/lng/NxBase";
    return LoadText(String(prefix + std::to_string(alLanguage) + kLngExtension)) ||
           LoadText(String(prefix + std::to_string(kFallbackLanguage) + kLngExtension));
}

bool Text::LoadText(const String& asBase, int alLanguage) {
    Store().language = alLanguage;
    if (LoadText(String(TextFileName(asBase, alLanguage)))) return true;
    if (alLanguage == kFallbackLanguage) return false;
    return LoadText(String(TextFileName(asBase, kFallbackLanguage)));
}

bool Text::LoadText(const String& asFileName) {
    const std::string& fileName = asFileName.str();
    Log("Loading text: " + Quoted(fileName));
    std::string bytes;
    if (!nxbase::detail::IsReadableFile(fileName) ||
        !nxbase::detail::ReadWholeFile(fileName, bytes)) {
        Log("Text file not readable: " + Quoted(fileName));
        return false;
    }
    nxbase::detail::ParseTextBytes(bytes, fileName);
    return true;
}

String Text::GetText(const String& asGroup, unsigned long alIndex) {
    const TextTable& table = Store().table;
    auto group = table.find(asGroup.str());
    if (group == table.end()) {
        Log("Missing group: " + asGroup.str());
        return String();
    }
    if (alIndex >= group->second.size()) {
        Log("Missing text: " + asGroup.str() + " " + std::to_string(alIndex));
        return String();
    }
    return String(group->second[alIndex]);
}

std::string Text::GetTextUtf8(const String& asGroup, unsigned long alIndex) {
    return toolkit::Windows1252ToUtf8(GetText(asGroup, alIndex).str());
}

unsigned long Text::GetEntryCount(const String& asGroup) {
    const TextTable& table = Store().table;
    auto group = table.find(asGroup.str());
    return group == table.end() ? 0 : static_cast<unsigned long>(group->second.size());
}

String Text::ConvertText(const String& asText) {
    return asText;
}

void Text::FreeResources() {
    Store().table.clear();
}

int Text::GetLanguage() {
    return Store().language;
}

bool Text::SyntaxError(const String& asFileName, char axMissing, const String& asGroup) {
    return UserInterface::Current()->QueryBox(
        nxbase::detail::SyntaxErrorMessage(GetLanguage(), asFileName.str(), axMissing,
                                           asGroup.str()),
        true);
}

void Text::LoadError(const String& asFileName, int alCode) {
    UserInterface::Current()->ErrorBox(
        nxbase::detail::LoadErrorMessage(GetLanguage(), asFileName.str(), alCode));
}

String TextSegment::operator[](unsigned long alIndex) const {
    return Text::GetText(amGroup, alIndex);
}
