// ASCIIFile reads and writes line-oriented data files: "[title]" lines and
// "key=value" lines (doc/asciifile.md). One object serves one thread.
// Error model: readers return false and never throw; output failures are
// latched in an error flag (CheckOutError, GetError); only ASCIIFile2 throws,
// std::logic_error, when asked to write.
#ifndef NXBASE_ASCIIFILE_H_
#define NXBASE_ASCIIFILE_H_

#include <boost/shared_ptr.hpp>
#include <cstdint>
#include <iosfwd>
#include <memory>
#include <string>
#include <vector>

#include "nxbase/export.h"
#include "toolkit/string.h"

// The reader is driven strictly in order: each Get... asks whether the
// current line holds the expected title or key. On success the file moves to
// the next line; on failure the line stays for another attempt.
class NXBASE_EXPORT ASCIIFile {
  public:
    // An ASCIIFileImpl on a file opened by name ("\" or "/" separators).
    static boost::shared_ptr<ASCIIFile> Get(const String& asFileName, bool axForReading,
                                            bool axTabMode = false);
    // An ASCIIFileImpl on the caller's stream, which must outlive the object.
    static boost::shared_ptr<ASCIIFile> Get(std::iostream* pStream, bool axForReading,
                                            bool axTabMode = false);

    ASCIIFile() = default;
    ASCIIFile(const ASCIIFile&) = delete;
    ASCIIFile& operator=(const ASCIIFile&) = delete;
    virtual ~ASCIIFile();

    // True once an output failure has been latched.
    virtual bool GetError() const = 0;
    // Hands the written lines to the output (the kernel, for a file opened by
    // name; no sync to the disk) and latches a failure of the output stream
    // (a full disk, a file removed while written) in the error flag.
    virtual void CheckOutError() = 0;
    // The format version read by CheckVersion or set by SetVersion.
    virtual int GetVersion() const = 0;
    // Stores a default number of decimals; PutReal/PutRealArray take theirs
    // from their own argument.
    virtual void SetPrecision(int alPrecision) = 0;
    // The value separator of arrays: one TAB in tab mode, else one blank.
    virtual String Trennzeichen() const = 0;

    // Reads lines until the title is found (true) or the input ends (false).
    virtual bool SkipToTitel(const String& asTitel) = 0;
    // Moves alCount lines on (fewer at the end of input); always true.
    virtual bool SkipLines(int alCount) = 0;
    // True when the current line is "[" asTitel "]" (compared byte for byte).
    virtual bool GetTitel(const String& asTitel) = 0;
    // An integer value; non-zero is true.
    virtual bool GetBOOL(const String& asKey, bool& axValue) = 0;
    // An integer value, clamped to the range of short.
    virtual bool GetShort(const String& asKey, short& axValue) = 0;
    // Exactly alCount values from the one key line into pValues[0..alCount).
    virtual bool GetShortArray(const String& asKey, short* pValues, int alCount) = 0;
    // Optional "-" and decimal digits; a lone "-" reads as 0. Clamped to int.
    virtual bool GetInt(const String& asKey, int& axValue) = 0;
    virtual bool GetIntArray(const String& asKey, int* pValues, int alCount) = 0;
    // Optional "-", digits, optional "." or "," and digits; no exponent.
    // Beyond the range of double the value is +-infinity, below it 0.
    virtual bool GetReal(const String& asKey, double& axValue) = 0;
    virtual bool GetRealArray(const String& asKey, double* pValues, int alCount) = 0;
    // The line "a3-a2-a1 a4:a5:a6".
    virtual bool GetDate(const String& asKey, int& axValue1, int& axValue2, int& axValue3,
                         int& axValue4, int& axValue5, int& axValue6) = 0;
    // Every consecutive line with this key, one element each; false (and an
    // empty vector) when the current line does not carry the key.
    virtual bool GetString(const String& asKey, std::vector<String>& axValues,
                           bool axRemoveTabs = false) = 0;
    // The rest of the line after "=", caret escapes decoded; with axRemoveTabs
    // every TAB is dropped from the value.
    virtual bool GetString(const String& asKey, String& asValue, bool axRemoveTabs = false) = 0;
    // Every consecutive line with this key, joined by line feeds.
    virtual bool GetMultilineString(const String& asKey, String& asValue,
                                    bool axRemoveTabs = false) = 0;
    // The whole rest of the current line, decoded, whatever its key; false
    // only at the end of input.
    virtual bool GetKeyString(String& asText, bool axRemoveTabs = false) = 0;

    // Each writer writes one complete line (the vector writer one per element).
    virtual void PutTitel(const String& asTitel) = 0;
    virtual void PutBOOL(const String& asKey, bool axValue) = 0;
    virtual void PutShort(const String& asKey, short axValue) = 0;
    // Elements right-aligned in fields of 6 characters.
    virtual void PutShortArray(const String& asKey, const short* pValues, int alCount) = 0;
    virtual void PutInt(const String& asKey, int axValue) = 0;
    // Elements right-aligned in fields of 7 characters.
    virtual void PutIntArray(const String& asKey, const int* pValues, int alCount) = 0;
    // Fixed notation with alPrecision decimals (0..40), "." as separator.
    virtual void PutReal(const String& asKey, double axValue, int alPrecision) = 0;
    virtual void PutRealArray(const String& asKey, const double* pValues, int alCount,
                              int alPrecision) = 0;
    // Writes "a3-a2-a1 a4:a5:a6", fields after the first two digits wide.
    virtual void PutDate(const String& asKey, int axValue1, int axValue2, int axValue3,
                         int axValue4, int axValue5, int axValue6) = 0;
    // One "key=element" line per element; nothing for an empty vector.
    virtual void PutString(const String& asKey, const std::vector<String>& axValues) = 0;
    // Control bytes other than TAB as "^" plus (byte + 64), "^" as "^" 0x9E.
    virtual void PutString(const String& asKey, const String& asValue) = 0;

    // Reads "[File]", "Application" and "Version"; true when all three were
    // read and 2 <= version <= alHighestKnown.
    virtual bool CheckVersion(int alHighestKnown) = 0;
    // Writes "[File]", "Application" (the version text of AppName) and
    // "Version". Throws std::logic_error when no AppName exists; then nothing
    // is written.
    virtual void SetVersion(int alVersion) = 0;
    virtual int& Version() = 0;
    // Consumed bytes over the file size, 0..1; -1 when the size is 0.
    virtual float GetPercentDone() const = 0;
    virtual const std::vector<String>& GetMessages() const = 0;
    virtual void AddMessages(const String& asMessage) = 0;
};

namespace nxbase::detail {
class DataFileStream;
// The body of SetVersion with the application's version text given: the
// "File" title, "Application" and "Version" lines; stores the version.
NXBASE_EXPORT void WriteVersionSection(ASCIIFile& axFile, int alVersion,
                                       const String& asApplication);
}  // namespace nxbase::detail

// The full implementation over an input or an output stream.
class NXBASE_EXPORT ASCIIFileImpl : public ASCIIFile {
  public:
    // Longest line kept; the rest of a longer line is skipped.
    static constexpr std::size_t kMaxLineLength = 64u << 20;
    // Bytes probed for a line feed when a file is opened by name.
    static constexpr std::size_t kLineFeedProbe = 1024;

    // By name. Reading: a file with a line feed in its first 1024 bytes is
    // read with the caret rules of current files, any other file with the
    // legacy rules (DOS code page). A file that cannot be opened reads as
    // empty. Writing: the file is emptied (or created) at once, keeping its
    // owner, permissions and links; each CheckOutError hands the lines
    // written so far to the kernel, and the destructor writes the rest and
    // syncs the file to the disk. The file always ends in a whole line: a
    // failed write is latched and taken back.
    ASCIIFileImpl(const String& asFileName, bool axForReading, bool axTabMode = false);
    // On the caller's stream (not owned). Reading starts at once with the
    // current caret rules; the size is unknown (0xFFFFFFFF).
    ASCIIFileImpl(std::iostream* pStream, bool axForReading, bool axTabMode = false);
    ~ASCIIFileImpl() override;

    const String& GetFileName() const { return amFileName; }
    // True when the input is exhausted and the current line is past its end.
    bool AtEnd() const { return amAtEnd; }

    bool GetError() const override { return amError; }
    void CheckOutError() override;
    int GetVersion() const override { return amVersion; }
    void SetPrecision(int alPrecision) override { amPrecision = alPrecision; }
    String Trennzeichen() const override;

    bool SkipToTitel(const String& asTitel) override;
    bool SkipLines(int alCount) override;
    bool GetTitel(const String& asTitel) override;
    bool GetBOOL(const String& asKey, bool& axValue) override;
    bool GetShort(const String& asKey, short& axValue) override;
    bool GetShortArray(const String& asKey, short* pValues, int alCount) override;
    bool GetInt(const String& asKey, int& axValue) override;
    bool GetIntArray(const String& asKey, int* pValues, int alCount) override;
    bool GetReal(const String& asKey, double& axValue) override;
    bool GetRealArray(const String& asKey, double* pValues, int alCount) override;
    bool GetDate(const String& asKey, int& axValue1, int& axValue2, int& axValue3, int& axValue4,
                 int& axValue5, int& axValue6) override;
    bool GetString(const String& asKey, std::vector<String>& axValues,
                   bool axRemoveTabs = false) override;
    bool GetString(const String& asKey, String& asValue, bool axRemoveTabs = false) override;
    bool GetMultilineString(const String& asKey, String& asValue,
                            bool axRemoveTabs = false) override;
    bool GetKeyString(String& asText, bool axRemoveTabs = false) override;

    void PutTitel(const String& asTitel) override;
    void PutBOOL(const String& asKey, bool axValue) override;
    void PutShort(const String& asKey, short axValue) override;
    void PutShortArray(const String& asKey, const short* pValues, int alCount) override;
    void PutInt(const String& asKey, int axValue) override;
    void PutIntArray(const String& asKey, const int* pValues, int alCount) override;
    void PutReal(const String& asKey, double axValue, int alPrecision) override;
    void PutRealArray(const String& asKey, const double* pValues, int alCount,
                      int alPrecision) override;
    void PutDate(const String& asKey, int axValue1, int axValue2, int axValue3, int axValue4,
                 int axValue5, int axValue6) override;
    void PutString(const String& asKey, const std::vector<String>& axValues) override;
    void PutString(const String& asKey, const String& asValue) override;

    bool CheckVersion(int alHighestKnown) override;
    void SetVersion(int alVersion) override;
    int& Version() override { return amVersion; }
    float GetPercentDone() const override;
    const std::vector<String>& GetMessages() const override { return amMessages; }
    void AddMessages(const String& asMessage) override { amMessages.push_back(asMessage); }

  private:
    // Line input.
    void ScanLine();
    bool Fail();
    bool Succeed();
    // Scanning primitives on the current line.
    bool SkipBlanks();
    bool SkipChar(char axChar);
    bool ScanString(char axStop, bool axRemoveTabs, std::string& out);
    bool ScanKey(const String& asKey);
    bool ScanLong(long long& axValue);
    bool ScanInt(int& axValue);
    bool ScanReal(double& axValue);
    template <class T>
    bool GetIntegers(const String& asKey, T* pValues, int alCount);
    // Line output.
    void StartKeyLine(const String& asKey);
    void EndLine();
    void LatchStreamState();

    bool amError = false;
    std::istream* pInput = nullptr;
    std::ostream* pOutput = nullptr;
    String amFileName;
    std::uint32_t amTotalSize = 0xFFFFFFFFu;
    std::uint32_t amConsumed = 0;
    std::string amLine;
    std::uint32_t amPos = 0;
    bool amLineFeed = true;
    bool amTabMode = false;
    bool amOwnsStream = false;
    int amVersion = 0;
    int amPrecision = 5;
    std::vector<String> amMessages;

    bool amAtEnd = false;
    // Scratch space, kept to spare allocations per line.
    std::string amScratch;
    std::string amKeyScratch;
    std::string amNumberScratch;
    std::vector<long long> amIntScratch;
    std::vector<double> amRealScratch;
    // The file opened by name, when amOwnsStream.
    std::unique_ptr<nxbase::detail::DataFileStream> pOwned;
};

// A read-only ASCIIFileImpl. Constructing it for writing throws
// std::logic_error("ASCIIFile 2 does not support write"); each writer throws
// std::logic_error("Unsupported operation").
class NXBASE_EXPORT ASCIIFile2 : public ASCIIFileImpl {
  public:
    ASCIIFile2(const String& asFileName, bool axForReading, bool axTabMode = false);
    ASCIIFile2(std::iostream* pStream, bool axForReading, bool axTabMode = false);
    ~ASCIIFile2() override;

    void PutTitel(const String& asTitel) override;
    void PutBOOL(const String& asKey, bool axValue) override;
    void PutShort(const String& asKey, short axValue) override;
    void PutShortArray(const String& asKey, const short* pValues, int alCount) override;
    void PutInt(const String& asKey, int axValue) override;
    void PutIntArray(const String& asKey, const int* pValues, int alCount) override;
    void PutReal(const String& asKey, double axValue, int alPrecision) override;
    void PutRealArray(const String& asKey, const double* pValues, int alCount,
                      int alPrecision) override;
    void PutDate(const String& asKey, int axValue1, int axValue2, int axValue3, int axValue4,
                 int axValue5, int axValue6) override;
    void PutString(const String& asKey, const std::vector<String>& axValues) override;
    void PutString(const String& asKey, const String& asValue) override;
};

#endif  // NXBASE_ASCIIFILE_H_
