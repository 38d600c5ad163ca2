// nxcolor: colour values of reflectance spectra (XYZ, Lab, LCh, xyY, DIN99,
// densities) under a chosen illuminant, observer and density standard, from a
// CSV or CGATS file or the built-in ColorChecker chart.
#include <charconv>
#include <cstdio>
#include <iostream>
#include <memory>
#include <string>
#include <vector>

#include "klume/cmetry/repository.h"
#include "nxbase/colorvector.h"
#include "nxbase/progress.h"
#include "measure.h"
#include "report.h"
#include "screen.h"
#include "spectra_csv.h"

namespace {

// Exit status.
constexpr int kExitOk = 0;
constexpr int kExitRowsRejected = 1;  // some rows bad, the others printed
constexpr int kExitUsage = 2;         // bad options, unreadable or unusable input

constexpr int kMaxPrecision = 9;
// Inputs from this many spectra on get a progress bar (on a terminal).
constexpr std::size_t kProgressMinRows = 20000;

const char kUsage[] =
    "Usage: nxcolor [options] [FILE]\n"
    "Prints the colour values of reflectance spectra: XYZ, CIELAB and LCh, and\n"
    "optionally xyY, DIN99 and densities, under one illuminant and observer.\n"
    "\n"
    "FILE is CSV: optional id columns, then 36 reflectance factors (0..1) for\n"
    "380..730 nm in 10 nm steps, one spectrum per line; a header line is\n"
    "optional and, when present, must name exactly those wavelengths (r380,\n"
    "380, nm380, SPEC_380, ...). A CGATS file (BEGIN_DATA_FORMAT with\n"
    "SPECTRAL_NM380..SPECTRAL_NM730 fields, SAMPLE_ID, SAMPLE_NAME) is read too.\n"
    "\"-\" reads standard input. Without FILE the built-in ColorChecker chart\n"
    "(BabelColor average, 24 patches) is used.\n"
    "\n"
    "Options:\n"
    "  -i, --illuminant NAME   A, C, D50 (default), D55, D65, D75, E, FL1..FL12,\n"
    "                          or one installed in $NXBASE_DATA_DIR/illuminants\n"
    "  -o, --observer 2|10     CIE 1931 2 degree (default) or CIE 1964 10 degree\n"
    "      --xyy               also print chromaticity x, y\n"
    "      --din99             also print DIN99 L99, a99, b99 (DIN 6176)\n"
    "  -d, --density NAME      also print densities D_RED, D_GREEN, D_BLUE of an\n"
    "                          ISO 5-3 standard: \"Status A\", \"Status E\",\n"
    "                          \"Status M\", \"Status T\", or one installed in\n"
    "                          $NXBASE_DATA_DIR/density\n"
    "  -f, --format table|csv|cgats\n"
    "                          output layout (default table)\n"
    "  -p, --precision N       decimals, 0..9 (default 4)\n"
    "      --percent           the values are percentages (0..100)\n"
    "      --rgb               also print the screen colour: sRGB R, G, B (0..255)\n"
    "                          and hex, through the ICC display profile when one\n"
    "                          is configured (user configuration nxcolor.ini,\n"
    "                          group Settings: ICCProfile=1, ICCProfilePath=FILE)\n"
    "      --icc-profile FILE  use this ICC display profile for --rgb and --report\n"
    "      --report FILE.svg   also draw the chart: a swatch per sample in its\n"
    "                          screen colour, with its id, Lab and reflectance curve\n"
    "      --measure N         measure N patches through the measuring-device\n"
    "                          server LumaServer (started from the registry when\n"
    "                          needed, locked for the run) instead of reading FILE\n"
    "      --list-illuminants  print the built-in illuminant names and exit\n"
    "  -h, --help              print this text and exit\n"
    "\n"
    "Numbers use \".\" as decimal separator in input and output, whatever the\n"
    "locale. A bad line (short row, text where a number belongs) is reported on\n"
    "standard error with its file and line; the other spectra are still printed.\n"
    "Exit status: 0 all spectra done, 1 some lines rejected, 2 usage error or\n"
    "unusable input (unreadable file, wavelength grid other than 380..730 nm).\n";

struct Options {
    std::string file;
    std::string illuminant = "D50";
    std::string observer = "2";
    std::string format = "table";
    std::string density;  // empty: no density columns
    int precision = 4;
    nxbase::SpectralReadOptions read;
    bool xyy = false;
    bool din99 = false;
    bool rgb = false;
    std::string iccProfile;
    std::string svgReport;
    bool listIlluminants = false;
    bool help = false;
    int measure = 0;  // patches to measure through LumaServer; 0: read a file
};

int UsageError(const std::string& message) {
    std::cerr << "nxcolor: " << message << "\nTry 'nxcolor --help'.\n";
    return kExitUsage;
}

// Parses argv into *options; an error message, or "" on success.
std::string ParseOptions(int argc, char** argv, Options* options) {
    std::vector<std::string> args(argv + 1, argv + argc);
    bool filesOnly = false;
    for (std::size_t i = 0; i < args.size(); ++i) {
        std::string arg = args[i];
        std::string value;
        bool hasValue = false;
        if (!filesOnly && arg.rfind("--", 0) == 0 && arg.find('=') != std::string::npos) {
            value = arg.substr(arg.find('=') + 1);
            arg = arg.substr(0, arg.find('='));
            hasValue = true;
        }
        auto take = [&](std::string* out) -> bool {
            if (hasValue) {
                *out = value;
                return true;
            }
            if (i + 1 >= args.size()) return false;
            *out = args[++i];
            return true;
        };
        if (filesOnly || arg == "-" || arg.empty() || arg[0] != '-') {
            if (!options->file.empty()) return "more than one input file";
            options->file = arg;
        } else if (arg == "--") {
            filesOnly = true;
        } else if (arg == "-h" || arg == "--help") {
            options->help = true;
        } else if (arg == "-i" || arg == "--illuminant") {
            if (!take(&options->illuminant)) return arg + " needs a name";
        } else if (arg == "-o" || arg == "--observer") {
            if (!take(&options->observer)) return arg + " needs 2 or 10";
        } else if (arg == "-d" || arg == "--density") {
            if (!take(&options->density)) return arg + " needs a standard's name";
        } else if (arg == "-f" || arg == "--format") {
            if (!take(&options->format)) return arg + " needs table, csv or cgats";
        } else if (arg == "-p" || arg == "--precision") {
            std::string text;
            if (!take(&text)) return arg + " needs a number";
            int n = -1;
            const auto r = std::from_chars(text.data(), text.data() + text.size(), n);
            if (r.ec != std::errc() || r.ptr != text.data() + text.size() || n < 0 || n > kMaxPrecision) {
                return "precision must be 0..9, not \"" + text + "\"";
            }
            options->precision = n;
        } else if (arg == "--percent" && !hasValue) {
            options->read.scale = nxbase::SpectralScale::kPercent;
        } else if (arg == "--fraction" && !hasValue) {
            options->read.scale = nxbase::SpectralScale::kFraction;
        } else if (arg == "--xyy" && !hasValue) {
            options->xyy = true;
        } else if (arg == "--din99" && !hasValue) {
            options->din99 = true;
        } else if (arg == "--rgb" && !hasValue) {
            options->rgb = true;
        } else if (arg == "--icc-profile") {
            if (!take(&options->iccProfile) || options->iccProfile.empty())
                return arg + " needs a file";
        } else if (arg == "--report") {
            if (!take(&options->svgReport) || options->svgReport.empty())
                return arg + " needs a file name";
        } else if (arg == "--measure") {
            std::string text;
            if (!take(&text)) return arg + " needs a number of patches";
            int n = 0;
            const auto r = std::from_chars(text.data(), text.data() + text.size(), n);
            if (r.ec != std::errc() || r.ptr != text.data() + text.size() || n < 1 || n > 100000) {
                return "--measure needs a number of patches from 1 to 100000, not \"" + text + "\"";
            }
            options->measure = n;
        } else if (arg == "--list-illuminants" && !hasValue) {
            options->listIlluminants = true;
        } else {
            return "unknown option " + args[i];
        }
    }
    return "";
}

}  // namespace

int main(int argc, char** argv) {
    Options options;
    const std::string problem = ParseOptions(argc, argv, &options);
    if (!problem.empty()) return UsageError(problem);
    if (options.help) {
        std::cout << kUsage;
        return kExitOk;
    }
    if (options.listIlluminants) {
        for (const std::string& name : klume::cmetry::IlluminantRepository::GetNames()) {
            std::cout << name << '\n';
        }
        return kExitOk;
    }

    std::string why;
    if (!klume::cmetry::IlluminantRepository::Find(options.illuminant, &why)) {
        return UsageError("unknown illuminant \"" + options.illuminant + "\"" +
                          (why.empty() ? "" : " (" + why + ")") +
                          "; see --list-illuminants");
    }
    const ObserverClass observer{String(options.observer)};
    if (observer.GetObserverType() == OBSERVER_UNKNOWN) {
        return UsageError("unknown observer \"" + options.observer + "\"; use 2 or 10");
    }
    if (!options.density.empty() &&
        !klume::cmetry::DensityStandardRepository::Exists(options.density)) {
        return UsageError("unknown or uninstalled density standard \"" + options.density + "\"");
    }
    const auto writer = nxcolor::Writers().find(options.format);
    if (writer == nxcolor::Writers().end()) {
        return UsageError("unknown format \"" + options.format + "\"; use table, csv or cgats");
    }

    nxcolor::SpectraTable table;
    std::string source;
    if (options.measure > 0) {
        if (!options.file.empty()) return UsageError("--measure takes no input file");
        source = "LumaServer";
        nxbase::TerminalProgressListener measuring("measuring");
        measuring.SetTotal(static_cast<std::uint64_t>(options.measure), "patches");
        std::string error;
        if (!nxcolor::MeasureThroughServer(options.measure, &table, &error, &measuring)) {
            std::cerr << "nxcolor: " << error << '\n';
            if (table.rows.empty()) return kExitUsage;
            table.errors.push_back(source + ": measuring stopped after " +
                                   std::to_string(table.rows.size()) + " patches");
        }
    } else if (options.file.empty()) {
        source = nxcolor::EmbeddedChartName();
        table = nxcolor::ParseSpectraCsv(nxcolor::EmbeddedChart(), source, options.read);
    } else {
        source = options.file == "-" ? "<stdin>" : options.file;
        std::string error;
        if (!nxcolor::ReadSpectraFile(options.file, options.read, &table, &error)) {
            std::cerr << "nxcolor: " << error << '\n';
            return kExitUsage;
        }
    }
    for (const std::string& error : table.errors) std::cerr << "nxcolor: " << error << '\n';
    if (table.unusable) return kExitUsage;
    if (table.rows.empty()) {
        std::cerr << "nxcolor: " << source << ": no spectra\n";
        return kExitUsage;
    }

    const MeasuringCondition condition(
        IllumClass(options.illuminant), observer,
        options.density.empty() ? DStdClass() : DStdClass(options.density), PhysicalConditions());
    std::vector<std::string> quantities = {"xyz", "lab", "lch"};
    if (options.xyy) quantities.push_back("xyy");
    if (options.din99) quantities.push_back("din99");
    if (!options.density.empty()) quantities.push_back("density");
    if (options.rgb) quantities.push_back("rgb");
    if (options.rgb || !options.svgReport.empty()) {
        const std::string warning = nxcolor::SetUpScreenColors(options.iccProfile);
        if (!warning.empty()) std::cerr << "nxcolor: " << warning << '\n';
    }
    // A bar on stderr for large inputs, drawn only when stderr is a terminal.
    std::unique_ptr<nxbase::TerminalProgressListener> bar;
    if (table.rows.size() >= kProgressMinRows) {
        bar = std::make_unique<nxbase::TerminalProgressListener>("nxcolor");
        bar->SetTotal(table.rows.size(), "spectra");
    }
    const nxcolor::Report report =
        nxcolor::Evaluate(table, source, condition, quantities, options.precision, bar.get());
    bar.reset();
    if (!options.svgReport.empty()) {
        std::string error;
        if (!nxcolor::WriteSvgReport(report, condition, options.svgReport, &error)) {
            std::cerr << "nxcolor: " << error << '\n';
            return kExitUsage;
        }
        std::cerr << "nxcolor: chart picture written to " << options.svgReport << '\n';
    }
    writer->second(report, std::cout);
    std::cout.flush();
    if (!std::cout) {
        std::cerr << "nxcolor: cannot write the output\n";
        return kExitUsage;
    }
    return table.errors.empty() ? kExitOk : kExitRowsRejected;
}
