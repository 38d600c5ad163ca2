// Files are read and written the same whatever locale the application runs
// in: every reader and writer under a decimal-comma locale (German, as a Qt
// application takes it from the desktop) gives the bytes it gives under "C".
#include <gtest/gtest.h>

#include <charconv>
#include <clocale>
#include <cstdio>
#include <cstdlib>
#include <locale>
#include <sstream>
#include <string>

#include "nxbase/asciifile.h"
#include "nxbase/configuration.h"
#include "nxbase/spectrafile.h"
#include "nxbase/strhelp.h"
#include "report.h"
#include "spectra_csv.h"
#include "test_util.h"

namespace {

constexpr const char* kDecimalComma = "de_DE.UTF-8";

// Makes the German locale available: the system's, or one compiled into
// `dir` (LOCPATH) from the locale sources Debian's "locales" package holds.
bool ProvideDecimalCommaLocale(const nxtest::TempDir& dir, std::string* why) {
    if (std::setlocale(LC_ALL, kDecimalComma)) return std::setlocale(LC_ALL, "C"), true;
    const std::string command = "localedef -i de_DE -f UTF-8 " + dir.File(kDecimalComma) + " > " +
                                dir.File("localedef.log") + " 2>&1";
    const int status = std::system(command.c_str());
    ::setenv("LOCPATH", dir.path().c_str(), 1);
    if (std::setlocale(LC_ALL, kDecimalComma)) return std::setlocale(LC_ALL, "C"), true;
    *why = "no de_DE.UTF-8 locale and localedef failed (status " + std::to_string(status) +
           "): install the \"locales\" package";
    return false;
}

std::string Values(double v, int count, char separator) {
    std::string text;
    for (int i = 0; i < count; ++i)
        text += (i ? std::string(1, separator) : "") + StringHelpers::Shortest(v + 0.001 * i);
    return text;
}

std::string CgatsFile(const std::string& identifier, const std::string& prefix) {
    std::string text =
        identifier + "\nNUMBER_OF_FIELDS 38\nBEGIN_DATA_FORMAT\nSAMPLE_ID SAMPLE_NAME";
    for (int nm = 380; nm <= 730; nm += 10) text += " " + prefix + std::to_string(nm);
    return text + "\nEND_DATA_FORMAT\nNUMBER_OF_SETS 2\nBEGIN_DATA\nA1 \"x\" " +
           Values(0.055, 36, ' ') + "\nA2 \"y\" " + Values(0.5, 36, ' ') + "\nEND_DATA\n";
}

// A spectral set as bytes: values in hexadecimal floating point, messages as they are.
std::string Dump(const nxbase::SpectralSet& set) {
    std::string out = set.format + (set.unusable ? " unusable\n" : "\n");
    for (const std::string& line : set.errors) out += "error " + line + "\n";
    for (const std::string& line : set.notes) out += "note " + line + "\n";
    for (const std::string& line : set.assumptions) out += "assumed " + line + "\n";
    out += "scale " + set.scaleNote + "\n";
    for (const double nm : set.wavelengths) out += StringHelpers::Shortest(nm) + " ";
    for (const nxbase::SpectralSample& sample : set.samples) {
        out += "\n" + sample.id + "|" + sample.name;
        for (const float v : sample.values) {
            char hex[32];
            out +=
                " " + std::string(hex, std::to_chars(hex, hex + 32, v, std::chars_format::hex).ptr);
        }
    }
    return out + "\n";
}

// Everything that reads or writes a file, run once; the bytes it gives.
std::string ReadAndWriteEverything(const nxtest::TempDir& dir) {
    std::string out;
    std::string csv = "id,name";
    for (int nm = 380; nm <= 730; nm += 10) csv += "," + std::to_string(nm);
    csv += "\n1,a," + Values(0.25, 36, ',') + "\n2,b," + Values(0.75, 36, ',') + "\n";
    std::string semicolons = csv;
    for (char& c : semicolons) c = c == ',' ? ';' : (c == '.' ? ',' : c);
    const std::string inputs[] = {CgatsFile("CGATS.17", "SPECTRAL_NM"),
                                  CgatsFile("CTI3", "SPEC_"),
                                  "SPECT\n" + CgatsFile("", "SPEC_").substr(1),
                                  csv,
                                  semicolons,
                                  CgatsFile("CGATS.17", "nm") + "SPECTRAL_NORM \"100,0\"\n"};
    for (const std::string& text : inputs) out += Dump(nxbase::ReadSpectralText(text, "in"));

    // nxcolor's four layouts of the chart, with the spectra kept.
    const auto table = nxcolor::ParseSpectraCsv(nxcolor::EmbeddedChart(), "chart");
    const MeasuringCondition condition(IllumClass("D65"), ObserverClass(OBSERVER_10DEG),
                                       PhysicalConditions());
    nxcolor::Report report = nxcolor::Evaluate(table, "chart", condition,
                                               {"xyz", "xyy", "lab", "lch", "din99", "density"}, 4);
    report.created = "2026-11-25T00:00:00Z";
    for (const char* layout : {"table", "csv", "cgats", "ti3"}) {
        std::ostringstream written;
        report.keepSpectra = std::string(layout) == "cgats";
        report.densityStandard = "Status T";
        nxcolor::Writers().at(layout)(report, written);
        out += written.str();
        out += Dump(nxbase::ReadSpectralText(written.str(), layout));
    }

    // The ASCII data files and the INI store.
    const std::string data = dir.File("values.dat");
    {
        auto file = ASCIIFile::Get(String(data), false);
        const double reals[3] = {0.5, -1234.5678, 1e-7};
        file->PutReal("Real", 3.25, 4);
        file->PutRealArray("Reals", reals, 3, 6);
        file->CheckOutError();
    }
    double real = 0, reals[3] = {};
    auto back = ASCIIFile::Get(String(data), true);
    out +=
        (back->GetReal("Real", real) && back->GetRealArray("Reals", reals, 3)) ? "read\n" : "no\n";
    out += StringHelpers::Fixed(real + reals[0] + reals[1] + reals[2], 9) + "\n";
    out += nxtest::ReadFile(data);
    IniConfig ini(dir.File("store.ini"));
    ini.WriteKey("Colour", "Tolerance", StringHelpers::Fixed(0.75, 2));
    out += ini.ReadKey("Colour", "Tolerance", "") + "\n" + nxtest::ReadFile(dir.File("store.ini"));
    out += std::string(GString(2.5, 3)) + " " + GString(-0.5, 3, 8).str() + "\n";
    for (const char* text : {"1234.5678", "7,25"})
        out += StringHelpers::Shortest(static_cast<double>(GString(text))) + "\n";
    return out;
}

TEST(Locale, ReadersAndWritersGiveTheSameBytesUnderADecimalCommaLocale) {
    nxtest::TempDir dir;
    std::string why;
    ASSERT_TRUE(ProvideDecimalCommaLocale(dir, &why)) << why;
    std::setlocale(LC_ALL, "C");
    const std::string plain = ReadAndWriteEverything(dir);
    ASSERT_THAT(plain, HasSubstr("1,dark skin,")) << plain.substr(0, 400);

    // The C library and the C++ streams both take the German decimal comma,
    // as an application that follows the desktop's language does.
    ASSERT_TRUE(std::setlocale(LC_ALL, kDecimalComma));
    const std::locale previous = std::locale::global(std::locale(kDecimalComma));
    char probe[16];
    std::snprintf(probe, sizeof probe, "%.1f", 0.5);
    const std::string german = ReadAndWriteEverything(dir);
    std::locale::global(previous);
    std::setlocale(LC_ALL, "C");
    ASSERT_STREQ(probe, "0,5") << "the locale does not write decimal commas";
    EXPECT_TRUE(german == plain) << german.size() << " bytes against " << plain.size();
    // Where they differ, the first line that does.
    std::istringstream a(plain), b(german);
    for (std::string x, y; std::getline(a, x) && std::getline(b, y);) {
        if (x != y) {
            ADD_FAILURE() << "C: " << x << "\nde_DE: " << y;
            break;
        }
    }
}

}  // namespace
