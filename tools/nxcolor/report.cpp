// nxcolor's quantities and output layouts.
#include "report.h"

#include <algorithm>
#include <charconv>
#include <cmath>
#include <ctime>
#include <optional>

#include "nxbase/finegrid.h"
#include "screen.h"

namespace nxcolor {
namespace {

// The process-wide Lab type set for one computation and restored after it.
class ScopedLabType {
  public:
    explicit ScopedLabType(LabColorSpaceType type) : amPrevious(LABVector::GetColorSpaceType()) {
        LABVector::SetColorSpaceType(type);
    }
    ~ScopedLabType() { LABVector::SetColorSpaceType(amPrevious); }
    ScopedLabType(const ScopedLabType&) = delete;
    ScopedLabType& operator=(const ScopedLabType&) = delete;

  private:
    LabColorSpaceType amPrevious;
};

void CopyThree(const ColorVector& v, float* pOut) {
    for (int i = 0; i < 3; ++i) pOut[i] = v[i];
}

using Triple = std::array<double, 3>;

void CopyTriple(const Triple& v, float* pOut) {
    for (int i = 0; i < 3; ++i) pOut[i] = static_cast<float>(v[i]);
}

// The levels and the packed hex code of a screen colour, as the rgb columns hold them.
void PutScreenColor(const ScreenColor& c, float* pOut) {
    pOut[0] = c.red;
    pOut[1] = c.green;
    pOut[2] = c.blue;
    pOut[3] = static_cast<float>((c.red << 16) | (c.green << 8) | c.blue);
}

// A CIE 1976 LABVector of values computed elsewhere.
LABVector LabOf(const Triple& lab, const MeasuringCondition& mc) {
    return LABVector(static_cast<float>(lab[0]), static_cast<float>(lab[1]),
                     static_cast<float>(lab[2]), mc);
}

std::vector<Quantity> MakeQuantities() {
    std::vector<Quantity> q;
    q.push_back({"xyz",
                 {{"X", "XYZ_X"}, {"Y", "XYZ_Y"}, {"Z", "XYZ_Z"}},
                 [](const ReflectanceSpectrum& s, const MeasuringCondition& mc, float* out) {
                     const CMetryFilter filter(Lichtart(mc.GetIllum()), Observer(mc.GetObserver()));
                     CopyThree(XYZVector(filter, s), out);
                 },
                 [](const Triple& xyz, const Triple&, const MeasuringCondition&, float* out) {
                     CopyTriple(xyz, out);
                 }});
    q.push_back({"xyy",
                 {{"x", "XYY_X"}, {"y", "XYY_Y"}, {"Y", "XYY_CAPY"}},
                 [](const ReflectanceSpectrum& s, const MeasuringCondition& mc, float* out) {
                     const CMetryFilter filter(Lichtart(mc.GetIllum()), Observer(mc.GetObserver()));
                     CopyThree(xyYVector(XYZVector(filter, s)), out);
                 },
                 [](const Triple& xyz, const Triple&, const MeasuringCondition&, float* out) {
                     const double sum = xyz[0] + xyz[1] + xyz[2];
                     CopyTriple({xyz[0] / sum, xyz[1] / sum, xyz[1]}, out);
                 }});
    q.push_back({"lab",
                 {{"L*", "LAB_L"}, {"a*", "LAB_A"}, {"b*", "LAB_B"}},
                 [](const ReflectanceSpectrum& s, const MeasuringCondition& mc, float* out) {
                     ScopedLabType cie(LAB_CIE1976);
                     CopyThree(LABVector(s, mc), out);
                 },
                 [](const Triple&, const Triple& lab, const MeasuringCondition&, float* out) {
                     CopyTriple(lab, out);
                 }});
    q.push_back({"lch",
                 {{"C*", "LAB_C"}, {"h", "LAB_H"}},
                 [](const ReflectanceSpectrum& s, const MeasuringCondition& mc, float* out) {
                     ScopedLabType cie(LAB_CIE1976);
                     const LABVector lab(s, mc);
                     out[0] = LChVector{lab}[1];
                     out[1] = static_cast<float>(nxbase::HueOfComputedLab(lab[1], lab[2]));
                 },
                 [](const Triple&, const Triple& lab, const MeasuringCondition& mc, float* out) {
                     out[0] = LChVector{LabOf(lab, mc)}[1];
                     out[1] = static_cast<float>(nxbase::HueOfComputedLab(lab[1], lab[2]));
                 }});
    q.push_back({"din99",
                 {{"L99", "DIN99_L"}, {"a99", "DIN99_A"}, {"b99", "DIN99_B"}},
                 [](const ReflectanceSpectrum& s, const MeasuringCondition& mc, float* out) {
                     ScopedLabType din(LAB_DIN99);
                     CopyThree(LABVector(s, mc), out);
                 },
                 [](const Triple&, const Triple& lab, const MeasuringCondition&, float* out) {
                     float cie[3];
                     CopyTriple(lab, cie);
                     nxbase::LabToDin99(cie, out, 1);
                 }});
    // ISO 5-3 status densities of the condition's density standard (red,
    // green, blue filter: cyan, magenta, yellow density); NaN where the
    // weighted reflectance is not positive.
    q.push_back({"density",
                 {{"D_RED", "D_RED"}, {"D_GREEN", "D_GREEN"}, {"D_BLUE", "D_BLUE"}},
                 [](const ReflectanceSpectrum& s, const MeasuringCondition& mc, float* out) {
                     thread_local std::string name;
                     thread_local DichteFilter filter;
                     if (name != mc.GetDStd().GetName()) {
                         filter = DichteFilter(mc.GetDStd());
                         name = mc.GetDStd().GetName();
                     }
                     for (unsigned short c = 0; c < 3; ++c) {
                         out[c] = std::nanf("");
                         filter.GetDensity(s, c, out[c]);
                     }
                 },
                 nullptr});
    // Screen colour levels 0..255 and their hex code (not a CGATS.17 field).
    Column hex{"hex", "SCREEN_HEX", 0, true, Column::Kind::kHexColor};
    q.push_back({"rgb",
                 {{"R", "RGB_R", 0, true}, {"G", "RGB_G", 0, true}, {"B", "RGB_B", 0, true}, hex},
                 [](const ReflectanceSpectrum& s, const MeasuringCondition& mc, float* out) {
                     PutScreenColor(ScreenColorOf(s, mc), out);
                 },
                 [](const Triple&, const Triple& lab, const MeasuringCondition& mc, float* out) {
                     PutScreenColor(ScreenColorOf(LabOf(lab, mc)), out);
                 }});

    return q;
}

bool NeedsQuotes(const std::string& text) {
    return text.find_first_of(",\"\n\r") != std::string::npos;
}

std::string CsvField(const std::string& text) {
    if (!NeedsQuotes(text)) return text;
    std::string out = "\"";
    for (char c : text) {
        if (c == '"') out += '"';
        out += c;
    }
    return out + "\"";
}

// The id and the name in columns of their own, as the readers take them back.
void WriteCsv(const Report& report, std::ostream& out) {
    out << "id,name";
    for (const Column& c : report.columns) out << ',' << CsvField(c.name);
    out << '\n';
    for (const ReportRow& row : report.rows) {
        const bool split = !row.sampleId.empty() || !row.sampleName.empty();
        out << CsvField(split ? row.sampleId : row.id) << ','
            << CsvField(split ? row.sampleName : std::string());
        for (std::size_t i = 0; i < row.values.size(); ++i) {
            out << ',' << FormatCell(row.values[i], report.columns[i]);
        }
        out << '\n';
    }
}

// A CGATS string. CGATS has no escapes: a text with double quotes is put in
// single ones, which the CGATS parsers read alike; only a text holding both
// kinds (or a line break, which no CGATS string can hold) has its double
// quotes and line breaks written as single quotes.
std::string CgatsString(const std::string& text) {
    const bool doubles = text.find('"') != std::string::npos;
    const bool singles = text.find('\'') != std::string::npos;
    const bool breaks = text.find_first_of("\r\n") != std::string::npos;
    if (doubles && !singles && !breaks) return "'" + text + "'";
    std::string out = "\"";
    for (char c : text) out += (c == '"' || c == '\n' || c == '\r') ? '\'' : c;
    return out + "\"";
}

std::string NowIso8601() {
    const std::time_t now = std::time(nullptr);
    std::tm utc{};
    gmtime_r(&now, &utc);
    char text[32];
    std::strftime(text, sizeof text, "%Y-%m-%dT%H:%M:%SZ", &utc);
    return text;
}

bool HasDensities(const Report& report) {
    return std::any_of(report.columns.begin(), report.columns.end(),
                       [](const Column& c) { return c.name == "D_RED"; });
}

// CGATS.17 as measurement software writes it: SAMPLE_ID and SAMPLE_NAME,
// the weighting function, and with keepSpectra the spectra in ArgyllCMS's
// SPEC_nnn fields with their grid declared, so that the file reads back as
// a measurement file.
void WriteCgats(const Report& report, std::ostream& out) {
    constexpr int kSpectrumDecimals = 6;
    const bool densities = HasDensities(report);
    out << "CGATS.17\n"
        << "ORIGINATOR " << CgatsString(report.originator) << "\n"
        << "CREATED " << CgatsString(report.created.empty() ? NowIso8601() : report.created) << "\n"
        << "DESCRIPTOR " << CgatsString(report.source) << "\n"
        << "WEIGHTING_FUNCTION " << CgatsString("ILLUMINANT, " + report.illuminant) << "\n"
        << "KEYWORD \"OBSERVER\"\nOBSERVER " << CgatsString(report.observer + " degree") << "\n"
        << "KEYWORD \"ILLUMINANT\"\nILLUMINANT " << CgatsString(report.illuminant) << "\n";
    if (densities)
        out << "KEYWORD \"DENSITY_STANDARD\"\nDENSITY_STANDARD "
            << CgatsString(report.densityStandard) << "\n";
    if (report.keepSpectra) {
        out << "SPECTRAL_BANDS \"" << kSpectrumSize << "\"\n"
            << "SPECTRAL_START_NM \"" << kFirstWavelength << "\"\n"
            << "SPECTRAL_END_NM \"" << kFirstWavelength + kWavelengthStep * (kSpectrumSize - 1)
            << "\"\n"
            << "SPECTRAL_NORM \"1.0\"\n";
    }
    out << "NUMBER_OF_FIELDS "
        << report.columns.size() + 2 + (report.keepSpectra ? kSpectrumSize : 0) << "\n"
        << "BEGIN_DATA_FORMAT\nSAMPLE_ID SAMPLE_NAME";
    for (const Column& c : report.columns) out << ' ' << c.cgats;
    if (report.keepSpectra) {
        for (int k = 0; k < kSpectrumSize; ++k)
            out << " SPEC_" << kFirstWavelength + kWavelengthStep * k;
    }
    out << "\nEND_DATA_FORMAT\n"
        << "NUMBER_OF_SETS " << report.rows.size() << "\n"
        << "BEGIN_DATA\n";
    for (const ReportRow& row : report.rows) {
        out << CgatsString(row.sampleId.empty() && row.sampleName.empty() ? row.id : row.sampleId)
            << ' ' << CgatsString(row.sampleName);
        for (std::size_t i = 0; i < row.values.size(); ++i) {
            const Column& column = report.columns[i];
            // Text cells (the screen colour's hex code) are quoted strings.
            if (column.kind == Column::Kind::kNumber) {
                out << ' ' << FormatNumber(row.values[i], column.precision);
            } else {
                out << ' ' << CgatsString(FormatCell(row.values[i], column));
            }
        }
        if (report.keepSpectra) {
            for (const float v : row.spectrum) out << ' ' << FormatNumber(v, kSpectrumDecimals);
        }
        out << '\n';
    }
    out << "END_DATA\n";
}

// The index of the column named `cgats` (its CGATS field name); -1 if absent.
int ColumnIndex(const Report& report, const char* cgats) {
    for (std::size_t i = 0; i < report.columns.size(); ++i) {
        if (report.columns[i].cgats == cgats) return static_cast<int>(i);
    }
    return -1;
}

// An ArgyllCMS measurement file (CTI3): the keywords and fields its tools
// require. CTI3 needs device values beside the measurement; the samples'
// screen colours (sRGB, 0..100) stand in for them. Spectra in percent.
void WriteTi3(const Report& report, std::ostream& out) {
    constexpr int kSpectrumDecimals = 4;
    const char* const kDevice[] = {"RGB_R", "RGB_G", "RGB_B"};
    const char* const kXyz[] = {"XYZ_X", "XYZ_Y", "XYZ_Z"};
    out << "CTI3\n\n"
        << "DESCRIPTOR \"Argyll Calibration Target chart information 3\"\n"
        << "ORIGINATOR " << CgatsString(report.originator) << "\n"
        << "CREATED " << CgatsString(report.created.empty() ? NowIso8601() : report.created) << "\n"
        << "KEYWORD \"DEVICE_CLASS\"\nDEVICE_CLASS \"OUTPUT\"\n"
        << "KEYWORD \"COLOR_REP\"\nCOLOR_REP \"RGB_XYZ\"\n"
        << "KEYWORD \"ILLUMINANT\"\nILLUMINANT " << CgatsString(report.illuminant) << "\n"
        << "KEYWORD \"OBSERVER\"\nOBSERVER " << CgatsString(report.observer + " degree") << "\n"
        << "KEYWORD \"SPECTRAL_BANDS\"\nSPECTRAL_BANDS \"" << kSpectrumSize << "\"\n"
        << "KEYWORD \"SPECTRAL_START_NM\"\nSPECTRAL_START_NM \"" << kFirstWavelength
        << ".000000\"\n"
        << "KEYWORD \"SPECTRAL_END_NM\"\nSPECTRAL_END_NM \""
        << kFirstWavelength + kWavelengthStep * (kSpectrumSize - 1) << ".000000\"\n"
        << "KEYWORD \"SPECTRAL_NORM\"\nSPECTRAL_NORM \"100.0\"\n\n"
        << "NUMBER_OF_FIELDS " << 2 + 3 + 3 + kSpectrumSize << "\n"
        << "BEGIN_DATA_FORMAT\nSAMPLE_ID SAMPLE_NAME RGB_R RGB_G RGB_B XYZ_X XYZ_Y XYZ_Z";
    for (int k = 0; k < kSpectrumSize; ++k)
        out << " SPEC_" << kFirstWavelength + kWavelengthStep * k;
    out << "\nEND_DATA_FORMAT\n\n"
        << "NUMBER_OF_SETS " << report.rows.size() << "\n"
        << "BEGIN_DATA\n";
    int device[3], xyz[3];
    for (int c = 0; c < 3; ++c) {
        device[c] = ColumnIndex(report, kDevice[c]);
        xyz[c] = ColumnIndex(report, kXyz[c]);
    }
    for (const ReportRow& row : report.rows) {
        out << CgatsString(row.sampleId.empty() && row.sampleName.empty() ? row.id : row.sampleId)
            << ' ' << CgatsString(row.sampleName);
        for (int c = 0; c < 3; ++c) {
            out << ' '
                << FormatNumber(device[c] < 0 ? 0.0f : row.values[device[c]] * (100.0f / 255.0f),
                                4);
        }
        for (int c = 0; c < 3; ++c)
            out << ' ' << FormatNumber(xyz[c] < 0 ? 0.0f : row.values[xyz[c]], 6);
        for (const float v : row.spectrum)
            out << ' ' << FormatNumber(100.0f * v, kSpectrumDecimals);
        out << '\n';
    }
    out << "END_DATA\n";
}

void WriteTable(const Report& report, std::ostream& out) {
    out << "# " << report.source << ": " << report.rows.size() << " spectra, illuminant "
        << report.illuminant << ", observer " << report.observer << "\xC2\xB0";
    if (HasDensities(report)) out << ", density " << report.densityStandard;
    out << '\n';
    std::size_t idWidth = 2;
    for (const ReportRow& row : report.rows) idWidth = std::max(idWidth, row.id.size());
    // Each column as wide as its widest entry.
    std::vector<std::size_t> widths;
    std::vector<std::vector<std::string>> cells(report.rows.size());
    for (std::size_t c = 0; c < report.columns.size(); ++c) {
        std::size_t width = report.columns[c].name.size();
        for (std::size_t r = 0; r < report.rows.size(); ++r) {
            cells[r].push_back(FormatCell(report.rows[r].values[c], report.columns[c]));
            width = std::max(width, cells[r].back().size());
        }
        widths.push_back(width);
    }
    auto pad = [&out](const std::string& text, std::size_t width, bool left) {
        if (left) out << text;
        for (std::size_t i = text.size(); i < width; ++i) out << ' ';
        if (!left) out << text;
    };
    pad("id", idWidth, true);
    for (std::size_t c = 0; c < report.columns.size(); ++c) {
        out << "  ";
        pad(report.columns[c].name, widths[c], false);
    }
    out << '\n';
    for (std::size_t r = 0; r < report.rows.size(); ++r) {
        pad(report.rows[r].id, idWidth, true);
        for (std::size_t c = 0; c < cells[r].size(); ++c) {
            out << "  ";
            pad(cells[r][c], widths[c], false);
        }
        out << '\n';
    }
}

}  // namespace

const std::vector<Quantity>& Quantities() {
    static const std::vector<Quantity> quantities = MakeQuantities();
    return quantities;
}

Report Evaluate(const SpectraTable& table, const std::string& source,
                const MeasuringCondition& condition, const std::vector<std::string>& quantities,
                int precision, ProgressListener* progress) {
    Report report;
    report.source = source;
    report.illuminant = condition.GetIllum().GetName();
    report.observer = condition.GetObserver().GetName().str();
    report.densityStandard = condition.GetDStd().GetName();
    std::vector<const Quantity*> chosen;
    for (const Quantity& q : Quantities()) {
        if (std::find(quantities.begin(), quantities.end(), q.key) == quantities.end()) continue;
        chosen.push_back(&q);
        for (Column c : q.columns) {
            if (!c.ownPrecision) c.precision = precision;
            report.columns.push_back(c);
        }
    }
    // Spectra finer than 10 nm: colour at their own interval.
    std::optional<nxbase::FineGridTristimulus> fine;
    if (table.fineGrid) fine.emplace(condition, table.sourceWavelengths);
    // Progress in steps of this many rows: cheap against the computation.
    constexpr std::size_t kProgressRows = 1024;
    for (const SpectrumRow& in : table.rows) {
        if (progress != nullptr && report.rows.size() % kProgressRows == 0)
            progress->DisplayProgress(static_cast<double>(report.rows.size()) / table.rows.size());
        ReportRow row;
        row.id = in.id;
        row.sampleId = in.sampleId;
        row.sampleName = in.sampleName;
        row.spectrum = in.values;
        const ReflectanceSpectrum spectrum(in.values.data(), PhysicalConditions());
        std::string bad;
        const bool atOwnInterval = fine && in.native.size() == fine->Wavelengths().size();
        const Triple xyz = atOwnInterval ? fine->ToXYZ(in.native.data()) : Triple{};
        const Triple lab = atOwnInterval ? fine->ToLab(in.native.data()) : Triple{};
        for (const Quantity* q : chosen) {
            float values[8] = {};
            if (atOwnInterval && q->fromColour) {
                q->fromColour(xyz, lab, condition, values);
            } else {
                q->compute(spectrum, condition, values);
            }
            for (std::size_t c = 0; c < q->columns.size() && bad.empty() && q->key != "density";
                 ++c) {
                if (!std::isfinite(values[c]))
                    bad = q->columns[c].name + " is " + FormatNumber(values[c], 0);
            }
            row.values.insert(row.values.end(), values, values + q->columns.size());
        }
        if (!bad.empty()) {
            report.errors.push_back(source + ":" + (in.line > 0 ? std::to_string(in.line) : "?") +
                                    ": " + bad + "; the spectrum is left out");
            continue;
        }
        report.rows.push_back(std::move(row));
    }
    if (progress != nullptr) progress->DisplayProgress(1.0);
    return report;
}

const std::map<std::string, Writer>& Writers() {
    static const std::map<std::string, Writer> writers = {
        {"table", WriteTable}, {"csv", WriteCsv}, {"cgats", WriteCgats}, {"ti3", WriteTi3}};
    return writers;
}

std::string FormatCell(float value, const Column& column) {
    if (column.kind == Column::Kind::kNumber) return FormatNumber(value, column.precision);
    static const char kDigits[] = "0123456789ABCDEF";
    auto packed = static_cast<std::uint32_t>(value);
    std::string text = "#";
    for (int shift = 20; shift >= 0; shift -= 4) text += kDigits[(packed >> shift) & 0xF];
    return text;
}

std::string FormatNumber(float value, int precision) {
    char buffer[64];
    double v = value;
    if (v == 0.0) v = 0.0;  // no "-0.0000"
    const auto result =
        std::to_chars(buffer, buffer + sizeof buffer, v, std::chars_format::fixed, precision);
    std::string text(buffer, result.ptr);
    // A tiny negative value rounds to "-0.00": print it unsigned.
    if (text.front() == '-' && text.find_first_not_of("-0.") == std::string::npos) text.erase(0, 1);
    return text;
}

}  // namespace nxcolor
