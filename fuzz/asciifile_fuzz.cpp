// Drives the ASCII data file reader through a sequence of reader calls that
// the input chooses. Layout of an input: one byte n (the program length,
// taken modulo 64), n program bytes, then the file's bytes. Program byte bit 7
// selects the file opened by name (line-feed probe, legacy decoding) instead
// of a stream; the low bits pick the reader, the middle bits its key.
// Values read back are written and read again to check the round trip.
#include <unistd.h>

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <limits>
#include <sstream>
#include <string>
#include <vector>

#include "nxbase/asciifile.h"

namespace {

const char* const kKeys[] = {"Name", "Value", "", "Data", "Version", "Application", "Date", "A B"};
const char* const kTitles[] = {"File", "Measurement", "", "Spectrum"};

String KeyOf(std::uint8_t op) {
    return kKeys[(op >> 3) & 7];
}

void Abort(const char* what) {
    std::fprintf(stderr, "round trip failed: %s\n", what);
    std::abort();
}

// A caret-free value written and read back through a stream is unchanged.
void CheckStringRoundTrip(const String& value, bool tabMode) {
    if (value.str().find('^') != std::string::npos) return;
    std::stringstream stream;
    {
        ASCIIFileImpl writer(&stream, false, tabMode);
        writer.PutString("K", value);
    }
    ASCIIFileImpl reader(&stream, true, tabMode);
    String back;
    if (!reader.GetString("K", back) || back != value) Abort("string");
}

void CheckIntRoundTrip(int value) {
    std::stringstream stream;
    {
        ASCIIFileImpl writer(&stream, false);
        writer.PutInt("K", value);
        int row[3] = {value, -value / 2, 7};
        writer.PutIntArray("R", row, 3);
    }
    ASCIIFileImpl reader(&stream, true);
    int back = 0;
    int row[3] = {};
    if (!reader.GetInt("K", back) || back != value) Abort("int");
    if (!reader.GetIntArray("R", row, 3) || row[0] != value || row[1] != -value / 2) {
        Abort("int array");
    }
}

void Run(ASCIIFileImpl& file, const std::uint8_t* program, std::size_t length, bool tabMode) {
    for (std::size_t i = 0; i < length; ++i) {
        std::uint8_t op = program[i];
        String key = KeyOf(op);
        bool removeTabs = (op & 0x40) != 0;
        switch (op & 15) {
            case 0:
                file.GetTitel(kTitles[(op >> 3) & 3]);
                break;
            case 1:
                file.SkipToTitel(kTitles[(op >> 3) & 3]);
                break;
            case 2:
                file.SkipLines((op >> 3) & 7);
                break;
            case 3: {
                bool value = false;
                file.GetBOOL(key, value);
                break;
            }
            case 4: {
                short value = 0;
                file.GetShort(key, value);
                break;
            }
            case 5: {
                int value = 0;
                if (file.GetInt(key, value) && value != std::numeric_limits<int>::min()) {
                    CheckIntRoundTrip(value);
                }
                break;
            }
            case 6: {
                double value = 0;
                file.GetReal(key, value);
                break;
            }
            case 7: {
                short values[5];
                file.GetShortArray(key, values, 1 + (op >> 6));
                break;
            }
            case 8: {
                int values[36];
                file.GetIntArray(key, values, (op & 0x40) ? 36 : 3);
                break;
            }
            case 9: {
                double values[36];
                file.GetRealArray(key, values, (op & 0x40) ? 36 : 2);
                break;
            }
            case 10: {
                int d[6];
                file.GetDate(key, d[0], d[1], d[2], d[3], d[4], d[5]);
                break;
            }
            case 11: {
                String value;
                if (file.GetString(key, value, removeTabs)) CheckStringRoundTrip(value, tabMode);
                break;
            }
            case 12: {
                std::vector<String> values;
                file.GetString(key, values, removeTabs);
                break;
            }
            case 13: {
                String value;
                file.GetMultilineString(key, value, removeTabs);
                break;
            }
            case 14: {
                String value;
                if (file.GetKeyString(value, removeTabs) && !removeTabs) {
                    CheckStringRoundTrip(value, tabMode);
                }
                break;
            }
            default:
                file.CheckVersion(3 + ((op >> 4) & 3));
                break;
        }
        float done = file.GetPercentDone();
        if (!(done == -1.0f || (done >= 0.0f && done <= 1.0f))) Abort("percent done");
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    if (size == 0) return 0;
    std::size_t programLength = std::min<std::size_t>(data[0] % 64, size - 1);
    const std::uint8_t* program = data + 1;
    std::string content(reinterpret_cast<const char*>(program + programLength),
                        size - 1 - programLength);
    bool byName = programLength > 0 && (program[0] & 0x80) != 0;
    bool tabMode = programLength > 0 && (program[0] & 0x20) != 0;

    if (byName) {
        // One scratch file per process, removed at exit.
        static const struct Scratch {
            std::string path = (std::filesystem::temp_directory_path() /
                                ("nxbase-asciifile-fuzz-" + std::to_string(::getpid()) + ".dat"))
                                   .string();
            ~Scratch() { std::remove(path.c_str()); }
        } scratch;
        const std::string& path = scratch.path;
        {
            std::ofstream out(path, std::ios::binary | std::ios::trunc);
            out << content;
        }
        ASCIIFileImpl file(String(path), true, tabMode);
        Run(file, program, programLength, tabMode);
    } else {
        std::stringstream stream(content);
        ASCIIFileImpl file(&stream, true, tabMode);
        Run(file, program, programLength, tabMode);
    }
    return 0;
}
