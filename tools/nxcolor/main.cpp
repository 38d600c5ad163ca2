// nxcolor: colour values of reflectance spectra (XYZ, Lab, LCh, xyY, DIN99,
// densities) under a chosen illuminant, observer and density standard, from a
// CSV or CGATS file or the built-in ColorChecker chart.
#include <cctype>
#include <cmath>
#include <cstdio>
#include <iostream>
#include <memory>
#include <string>
#include <vector>

#include "compare.h"
#include "klume/cmetry/repository.h"
#include "measure.h"
#include "nxbase/colorvector.h"
#include "nxbase/progress.h"
#include "nxbase/strhelp.h"
#include "nxbase/version.h"
#include "report.h"
#include "screen.h"
#include "spectra_csv.h"

namespace {

// Exit status.
constexpr int kExitOk = 0;
constexpr int kExitRowsRejected = 1;   // some rows bad, the others printed
constexpr int kExitUsage = 2;          // bad options, unreadable or unusable input
constexpr int kExitOverTolerance = 3;  // --compare: a pair above --tolerance

constexpr int kMaxPrecision = 9;

// A finite decimal number that fills the whole text.
bool ParseWholeNumber(const std::string& text, double* value) {
    return StringHelpers::ParseDecimal(text, *value);
}
// Inputs from this many spectra on get a progress bar (on a terminal).
constexpr std::size_t kProgressMinRows = 20000;

const char kUsage[] =
    "Usage: nxcolor [options] [FILE]\n"
    "       nxcolor --compare [options] REFERENCE SAMPLE\n"
    "Prints the colour values of reflectance spectra: XYZ, CIELAB and LCh, and\n"
    "optionally xyY, DIN99 and densities, under one illuminant and observer;\n"
    "or compares samples with their references (--compare).\n"
    "\n"
    "FILE is CSV or CGATS, one spectrum per line or set, on any wavelength grid:\n"
    "  CSV: optional id columns (id, then name), then the values; a header names\n"
    "    the wavelengths (r380, 380, 380.0, nm380, SPEC_380, 380nm, ...),\n"
    "    increasing or decreasing. Without a header the last 36 fields are\n"
    "    380..730 nm in 10 nm steps.\n"
    "  CGATS (CGATS.17, ArgyllCMS .ti3/.sp, X-Rite, LittleCMS): SAMPLE_ID,\n"
    "    SAMPLE_NAME and spectral fields SPEC_nnn, nmnnn, SPECTRAL_NM_nnn, ...\n"
    "    whose names give the wavelengths.\n"
    "Spectra must cover 400..700 nm. On another grid they are brought onto\n"
    "380..730 nm / 10 nm: the 10 nm points when the file has them, else Sprague\n"
    "interpolation (equal steps) or linear (uneven steps), the end values held\n"
    "outside the measured range (said on stderr); finer regular grids are\n"
    "summed at their own interval.\n"
    "Values are percentages when the file says so (SPECTRAL_NORM, ArgyllCMS\n"
    "CTI3) or every spectrum needs it (a value above 1.5), reflectance factors\n"
    "(0..1) when none does; a file whose spectra disagree is refused unless\n"
    "--percent or --fraction says which it holds.\n"
    "\"-\" reads standard input. Without FILE the built-in ColorChecker chart\n"
    "(BabelColor average, 24 patches) is used.\n"
    "\n"
    "Options:\n"
    "  -i, --illuminant NAME   A, C, D50 (default), D55, D65, D75, E, FL1..FL12\n"
    "                          (F1..F12, any case), one installed in\n"
    "                          $NXBASE_DATA_DIR/illuminants, or a CSV file\n"
    "                          (wavelength,value) given by its path\n"
    "  -o, --observer 2|10     CIE 1931 2 degree (default) or CIE 1964 10 degree\n"
    "      --xyy               also print chromaticity x, y\n"
    "      --din99             also print DIN99 L99, a99, b99 (DIN 6176)\n"
    "  -d, --density NAME      also print densities D_RED, D_GREEN, D_BLUE of an\n"
    "                          ISO 5-3 standard: \"Status A\", \"Status E\",\n"
    "                          \"Status M\", \"Status T\", one installed in\n"
    "                          $NXBASE_DATA_DIR/density, or a table by its path\n"
    "  -f, --format table|csv|cgats|ti3\n"
    "                          output layout (default table); ti3: an ArgyllCMS\n"
    "                          measurement file with the spectra (CTI3)\n"
    "      --keep-spectra      with -f cgats: also write the spectra, so that the\n"
    "                          output is a CGATS measurement file (SPEC_nnn)\n"
    "  -p, --precision N       decimals, 0..9 (default 4; 2 with --compare)\n"
    "      --percent           the values are percentages (0..100)\n"
    "      --fraction          the values are reflectance factors (0..1)\n"
    "      --rgb               also print the screen colour: sRGB R, G, B (0..255)\n"
    "                          and hex, through the ICC display profile when one\n"
    "                          is configured (user configuration nxcolor.ini,\n"
    "                          group Settings: ICCProfile=1, ICCProfilePath=FILE)\n"
    "      --icc-profile FILE  use this ICC display profile for --rgb, --report, --plot\n"
    "      --report FILE.svg   also draw the chart: a swatch per sample in its\n"
    "                          screen colour, with its id, Lab and reflectance curve\n"
    "      --plot FILE.svg     also plot the spectral curves: reflectance against\n"
    "                          wavelength, a line per sample in its screen colour\n"
    "      --measure N         measure N patches through the measuring-device\n"
    "                          server LumaServer (started from the registry when\n"
    "                          needed, locked for the run) instead of reading FILE\n"
    "      --list-illuminants  print the built-in and installed illuminants and exit\n"
    "  -v, --verbose           say on standard error how the input was read\n"
    "      --version           print the version and exit\n"
    "  -h, --help              print this text and exit\n"
    "\n"
    "Comparing (sample against standard):\n"
    "      --compare           read REFERENCE and SAMPLE; print per sample dL*, dC*,\n"
    "                          dH* (sample minus reference) and a colour difference,\n"
    "                          then mean, max, 95th percentile and the worst samples\n"
    "      --de 2000|94|94t|cmc|cmc11|ab\n"
    "                          the colour difference: CIEDE2000 (default), CIE94\n"
    "                          graphic arts or textiles, CMC(2:1) or (1:1), CIE76\n"
    "      --by-order          pair the n-th sample with the n-th reference\n"
    "                          (default: by SAMPLE_ID, or the id column)\n"
    "      --tolerance X       exit status 3 when a pair's difference exceeds X\n"
    "\n"
    "Numbers use \".\" as decimal separator in input and output, whatever the\n"
    "locale. A bad line (short row, text where a number belongs, a spectrum that\n"
    "is no reflectance or gives no finite colour) is reported on standard error\n"
    "with its file and line; the other spectra are still printed.\n"
    "Exit status: 0 all spectra done, 1 some lines rejected, 2 usage error or\n"
    "unusable input, 3 a comparison above its tolerance.\n";

struct Options {
    std::string file;
    std::string secondFile;  // --compare: the samples
    bool compare = false;
    nxcolor::CompareOptions compareOptions;
    bool precisionGiven = false;
    bool keepSpectra = false;
    bool verbose = false;
    bool version = false;
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
    std::string svgPlot;
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
            if (options->file.empty()) {
                options->file = arg;
            } else if (options->secondFile.empty()) {
                options->secondFile = arg;
            } else {
                return "more than two input files";
            }
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
            long long n = -1;
            if (!StringHelpers::ParseInteger(text, n) || n < 0 || n > kMaxPrecision) {
                return "precision must be 0..9, not \"" + text + "\"";
            }
            options->precision = static_cast<int>(n);
            options->precisionGiven = true;
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
        } else if (arg == "--plot") {
            if (!take(&options->svgPlot) || options->svgPlot.empty())
                return arg + " needs a file name";
        } else if (arg == "--measure") {
            std::string text;
            if (!take(&text)) return arg + " needs a number of patches";
            long long n = 0;
            if (!StringHelpers::ParseInteger(text, n) || n < 1 || n > 100000) {
                return "--measure needs a number of patches from 1 to 100000, not \"" + text + "\"";
            }
            options->measure = static_cast<int>(n);
        } else if (arg == "--compare" && !hasValue) {
            options->compare = true;
        } else if (arg == "--by-order" && !hasValue) {
            options->compareOptions.byOrder = true;
        } else if (arg == "--de") {
            std::string text;
            if (!take(&text) ||
                !nxbase::ParseDeltaEMethod(text.c_str(), &options->compareOptions.method)) {
                return "--de needs 2000, 94, 94t, cmc, cmc11 or ab";
            }
        } else if (arg == "--tolerance") {
            std::string text;
            double x = -1.0;
            if (!take(&text) || !ParseWholeNumber(text, &x) || x < 0.0) {
                return "--tolerance needs a colour difference of 0 or more, not \"" + text + "\"";
            }
            options->compareOptions.tolerance = x;
        } else if (arg == "--keep-spectra" && !hasValue) {
            options->keepSpectra = true;
        } else if ((arg == "-v" || arg == "--verbose") && !hasValue) {
            options->verbose = true;
        } else if (arg == "--version" && !hasValue) {
            options->version = true;
        } else if (arg == "--list-illuminants" && !hasValue) {
            options->listIlluminants = true;
        } else {
            return "unknown option " + args[i];
        }
    }
    return "";
}

bool LooksLikePath(const std::string& name) {
    return name.find('/') != std::string::npos ||
           (name.size() > 4 && name.compare(name.size() - 4, 4, ".csv") == 0);
}

// Resolves -i: a built-in or installed name, or a table by path. "" or the
// reason it cannot be used.
std::string ResolveIlluminant(Options* options) {
    if (LooksLikePath(options->illuminant)) {
        std::string name;
        std::string error;
        if (!klume::cmetry::IlluminantRepository::AddFile(options->illuminant, &name, &error))
            return error;
        options->illuminant = name;
        return "";
    }
    options->illuminant = klume::cmetry::IlluminantRepository::CanonicalName(options->illuminant);
    std::string why;
    if (!klume::cmetry::IlluminantRepository::Find(options->illuminant, &why)) {
        return (why.empty() ? "unknown illuminant \"" + options->illuminant + "\"" : why) +
               "; see --list-illuminants";
    }
    return "";
}

std::string ResolveDensity(Options* options) {
    if (options->density.empty()) return "";
    if (LooksLikePath(options->density)) {
        std::string name;
        std::string error;
        if (!klume::cmetry::DensityStandardRepository::AddFile(options->density, &name, &error))
            return error;
        options->density = name;
        return "";
    }
    std::string why;
    if (!klume::cmetry::DensityStandardRepository::Find(options->density, &why)) {
        return why.empty() ? "unknown density standard \"" + options->density + "\"" : why;
    }
    return "";
}

// Reads one input; false (after saying why) when it gives nothing usable.
bool ReadInput(const std::string& file, const Options& options, nxcolor::SpectraTable* table,
               std::string* source) {
    std::string error;
    if (file.empty()) {
        *source = nxcolor::EmbeddedChartName();
        // The built-in chart is stored as reflectance factors.
        nxbase::SpectralReadOptions chart = options.read;
        chart.scale = nxbase::SpectralScale::kFraction;
        *table = nxcolor::ParseSpectraCsv(nxcolor::EmbeddedChart(), *source, chart);
    } else {
        *source = file == "-" ? "<stdin>" : file;
        if (!nxcolor::ReadSpectralFile(file, options.read, table, &error) &&
            table->errors.empty()) {
            std::cerr << "nxcolor: " << error << '\n';
            return false;
        }
    }
    for (const std::string& message : table->errors) std::cerr << "nxcolor: " << message << '\n';
    // A guessed scale and held ends are said every time: they change the numbers.
    if (!table->scaleNote.empty()) std::cerr << "nxcolor: " << table->scaleNote << '\n';
    for (const std::string& assumption : table->assumptions)
        std::cerr << "nxcolor: " << assumption << '\n';
    if (options.verbose) {
        for (const std::string& note : table->notes) std::cerr << "nxcolor: " << note << '\n';
        if (!table->sourceWavelengths.empty()) {
            std::cerr << "nxcolor: " << *source << ": " << table->rows.size() << " spectra, "
                      << table->sourceWavelengths.size() << " wavelengths "
                      << table->sourceWavelengths.front() << ".." << table->sourceWavelengths.back()
                      << " nm, " << table->resampling << ", "
                      << (table->percent ? "percent" : "reflectance factors")
                      << (table->fineGrid ? "; colour summed at the file's own interval" : "")
                      << '\n';
        }
    }
    if (table->unusable) return false;
    if (table->rows.empty()) {
        std::cerr << "nxcolor: " << *source << ": no spectra\n";
        return false;
    }
    return true;
}

int RunCompare(Options& options, const MeasuringCondition& condition) {
    if (options.file.empty() || options.secondFile.empty()) {
        return UsageError("--compare needs a REFERENCE and a SAMPLE file");
    }
    nxcolor::SpectraTable reference, sample;
    std::string referenceName, sampleName;
    if (!ReadInput(options.file, options, &reference, &referenceName)) return kExitUsage;
    if (!ReadInput(options.secondFile, options, &sample, &sampleName)) return kExitUsage;
    options.compareOptions.precision = options.precisionGiven ? options.precision : 2;
    options.compareOptions.csv = options.format == "csv";
    if (options.format != "table" && options.format != "csv")
        return UsageError("--compare writes table or csv");
    const nxcolor::Comparison comparison =
        nxcolor::Compare(reference, sample, condition, options.compareOptions);
    // A thousand unmatched samples say no more than the first few.
    constexpr std::size_t kShownProblems = 10;
    for (std::size_t i = 0; i < comparison.problems.size() && i < kShownProblems; ++i) {
        std::cerr << "nxcolor: " << comparison.problems[i] << '\n';
    }
    if (comparison.problems.size() > kShownProblems) {
        std::cerr << "nxcolor: ... and " << comparison.problems.size() - kShownProblems
                  << " more\n";
    }
    if (comparison.pairs.empty()) {
        std::cerr << "nxcolor: no sample of " << sampleName << " has a reference in "
                  << referenceName << " (the ids differ; --by-order pairs by position)\n";
        return kExitUsage;
    }
    const std::string header = sampleName + " against " + referenceName + ": illuminant " +
                               options.illuminant + ", observer " + options.observer +
                               "\xC2\xB0, " +
                               nxbase::DeltaEMethodName(options.compareOptions.method);
    nxcolor::WriteComparison(comparison, options.compareOptions, header, std::cout);
    for (const std::string& line : nxcolor::SummaryLines(comparison, options.compareOptions)) {
        (options.compareOptions.csv ? std::cerr : std::cout) << "# " << line << '\n';
    }
    std::cout.flush();
    if (!std::cout) {
        std::cerr << "nxcolor: cannot write the output\n";
        return kExitUsage;
    }
    if (comparison.overTolerance > 0) return kExitOverTolerance;
    const bool rejected =
        !reference.errors.empty() || !sample.errors.empty() || !comparison.problems.empty();
    return rejected ? kExitRowsRejected : kExitOk;
}

int Run(Options& options) {
    if (options.help) {
        std::cout << kUsage;
        return kExitOk;
    }
    if (options.version) {
        std::cout << "nxcolor (NxBase) " << nxbase::Version() << '\n';
        return kExitOk;
    }
    if (options.listIlluminants) {
        for (const std::string& name : klume::cmetry::IlluminantRepository::GetNames())
            std::cout << name << '\n';
        for (const std::string& name : klume::cmetry::IlluminantRepository::GetInstalledNames()) {
            std::cout << name << " (installed)\n";
        }
        return kExitOk;
    }
    const std::string illuminantProblem = ResolveIlluminant(&options);
    if (!illuminantProblem.empty()) return UsageError(illuminantProblem);
    const ObserverClass observer{String(options.observer)};
    if (observer.GetObserverType() == OBSERVER_UNKNOWN) {
        return UsageError("unknown observer \"" + options.observer + "\"; use 2 or 10");
    }
    const std::string densityProblem = ResolveDensity(&options);
    if (!densityProblem.empty()) return UsageError(densityProblem);
    const auto writer = nxcolor::Writers().find(options.format);
    if (writer == nxcolor::Writers().end()) {
        return UsageError("unknown format \"" + options.format +
                          "\"; use table, csv, cgats or ti3");
    }
    if (options.keepSpectra && options.format != "cgats")
        return UsageError("--keep-spectra needs -f cgats");
    const MeasuringCondition condition(
        IllumClass(options.illuminant), observer,
        options.density.empty() ? DStdClass() : DStdClass(options.density), PhysicalConditions());
    if (options.compare) return RunCompare(options, condition);
    if (!options.secondFile.empty())
        return UsageError("more than one input file (--compare takes two)");

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
            std::cerr << "nxcolor: " << table.errors.back() << '\n';
        }
    } else if (!ReadInput(options.file, options, &table, &source)) {
        return kExitUsage;
    }

    std::vector<std::string> quantities = {"xyz", "lab", "lch"};
    if (options.xyy) quantities.push_back("xyy");
    if (options.din99) quantities.push_back("din99");
    if (!options.density.empty()) quantities.push_back("density");
    // A CTI3 file carries the screen colours as its device values.
    if (options.rgb || options.format == "ti3") quantities.push_back("rgb");
    if (options.rgb || options.format == "ti3" || !options.svgReport.empty() ||
        !options.svgPlot.empty()) {
        const std::string warning = nxcolor::SetUpScreenColors(options.iccProfile);
        // A profile asked for on the command line that cannot be used is an
        // error; one from the configuration falls back to the formulas.
        if (!warning.empty() && !options.iccProfile.empty()) return UsageError(warning);
        if (!warning.empty()) std::cerr << "nxcolor: " << warning << '\n';
    } else if (!options.iccProfile.empty()) {
        return UsageError("--icc-profile needs --rgb, --report or --plot");
    }
    // A bar on stderr for large inputs, drawn only when stderr is a terminal.
    std::unique_ptr<nxbase::TerminalProgressListener> bar;
    if (table.rows.size() >= kProgressMinRows) {
        bar = std::make_unique<nxbase::TerminalProgressListener>("nxcolor");
        bar->SetTotal(table.rows.size(), "spectra");
    }
    nxcolor::Report report =
        nxcolor::Evaluate(table, source, condition, quantities, options.precision, bar.get());
    bar.reset();
    report.keepSpectra = options.keepSpectra;
    report.originator = std::string("nxcolor ") + nxbase::Version();
    for (const std::string& error : report.errors) std::cerr << "nxcolor: " << error << '\n';
    using Picture = bool (*)(const nxcolor::Report&, const MeasuringCondition&, const std::string&,
                             std::string*);
    const std::pair<const std::string*, std::pair<Picture, const char*>> pictures[] = {
        {&options.svgReport, {&nxcolor::WriteSvgReport, "chart picture"}},
        {&options.svgPlot, {&nxcolor::WriteSvgPlot, "spectral plot"}},
    };
    for (const auto& [path, picture] : pictures) {
        if (path->empty()) continue;
        std::string error;
        if (!picture.first(report, condition, *path, &error)) {
            std::cerr << "nxcolor: " << error << '\n';
            return kExitUsage;
        }
        std::cerr << "nxcolor: " << picture.second << " written to " << *path << '\n';
    }
    writer->second(report, std::cout);
    std::cout.flush();
    if (!std::cout) {
        std::cerr << "nxcolor: cannot write the output\n";
        return kExitUsage;
    }
    return table.errors.empty() && report.errors.empty() ? kExitOk : kExitRowsRejected;
}

}  // namespace

int main(int argc, char** argv) {
    Options options;
    const std::string problem = ParseOptions(argc, argv, &options);
    if (!problem.empty()) return UsageError(problem);
    try {
        return Run(options);
    } catch (const std::bad_alloc&) {
        std::cerr << "nxcolor: out of memory; split the input into smaller files\n";
        return kExitUsage;
    }
}
