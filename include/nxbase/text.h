// Text holds the application's user-visible texts: one language file of
// named text groups, each an ordered list of texts addressed by a zero-based
// index. The store is process-wide and has no lock: load it on one thread at
// start-up and read it afterwards from any thread. Error model: loading
// returns false, lookups answer an empty string and log; nothing throws.
#ifndef NXBASE_TEXT_H_
#define NXBASE_TEXT_H_

#include <cstddef>
#include <string>
#include <string_view>

#include "nxbase/export.h"
#include "toolkit/string.h"

class NXBASE_EXPORT Text {
  public:
    // The language whose file is loaded when the requested one is missing.
    static constexpr int kFallbackLanguage = 1;
    // The number of text groups the load-error message with code 2 quotes.
    static constexpr unsigned long kMaxTextGroups = 10000;

    // Stores `alLanguage` as the current language number and loads
    // <base><language>.lng (for example Texte49.lng) from the application's
    // language directory; a base that holds a directory part is taken as the
    // path prefix itself. When that file cannot be read the file of
    // kFallbackLanguage is loaded instead. True when either file was read.
    static bool LoadText(const String& asBase, int alLanguage);

    // Loads the library's own texts (colour names, group "FarbTexte"; the
    // post office's waiting dialog, group "ObjectIdApplikation"),
    // NxBase<language>.lng from nxbase::LibraryDataDirectory()/lng, falling
    // back to kFallbackLanguage; needs no AppDir. True when a file was read.
    static bool LoadLibraryTexts(int alLanguage);

    // Parses the named file into the table. Groups already present keep
    // their texts (the first definition wins), so call FreeResources()
    // before loading another language. False when the file cannot be read.
    static bool LoadText(const String& asFileName);

    // The text, or "" (with a log line) when the group or the index is missing.
    static String GetText(const String& asGroup, unsigned long alIndex);
    // The same text in UTF-8, for user interfaces drawn with GTK or Qt.
    static std::string GetTextUtf8(const String& asGroup, unsigned long alIndex);
    // The number of texts of the group, 0 for an unknown group.
    static unsigned long GetEntryCount(const String& asGroup);
    // Returns its argument unchanged.
    static String ConvertText(const String& asText);
    // Empties the table.
    static void FreeResources();

    // The language number stored by LoadText(base, language); 49 selects
    // German messages, every other number English.
    static int GetLanguage();

    // Reports a syntax error of a text file (the character `axMissing` is
    // missing in `asGroup`) in a yes/no box and returns the answer (yes:
    // continue).
    static bool SyntaxError(const String& asFileName, char axMissing, const String& asGroup);
    // Reports a load error in an error box: code 1 "unable to open text
    // file", 2 too many text groups, any other a general error.
    static void LoadError(const String& asFileName, int alCode);
};

// A handle on one text group, so that callers can write segment[index].
class NXBASE_EXPORT TextSegment {
  public:
    explicit TextSegment(const String& asGroup) : amGroup(asGroup) {}

    // Text::GetText(group, index).
    String operator[](unsigned long alIndex) const;
    const String& GetGroup() const { return amGroup; }

  private:
    String amGroup;
};

namespace nxbase::detail {

// The path prefix of the text files of `base`: `base` itself when it holds a
// directory part, else `base` in the application's language directory
// (AppDir's LngDirEntry), or `base` as given when no AppDir exists.
NXBASE_EXPORT std::string TextFilePrefix(const String& base);

// Parses the bytes of a text file into the process-wide table, exactly as
// Text::LoadText(fileName) does after reading the file; `fileName` only
// names the file in log lines. Any bytes are accepted.
NXBASE_EXPORT void ParseTextBytes(std::string_view bytes, const std::string& fileName);

// The message texts of the two error reporters, in German for language 49
// and in English otherwise.
NXBASE_EXPORT std::string SyntaxErrorMessage(int language, const std::string& fileName,
                                             char missing, const std::string& group);
NXBASE_EXPORT std::string LoadErrorMessage(int language, const std::string& fileName, int code);

// UTF-8 to the ANSI code page (Windows-1252); every character the code page
// cannot hold and every malformed byte becomes "?".
NXBASE_EXPORT std::string Utf8ToAnsi(std::string_view utf8);
// The reverse: ANSI (Windows-1252) text in UTF-8; every byte has a character,
// so Utf8ToAnsi(AnsiToUtf8(x)) == x.
NXBASE_EXPORT std::string AnsiToUtf8(std::string_view ansi);

}  // namespace nxbase::detail

#endif  // NXBASE_TEXT_H_
