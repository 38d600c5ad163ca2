// Sample against standard; see compare.h.
#include "compare.h"

#include <algorithm>
#include <cmath>
#include <map>
#include <numeric>
#include <optional>

#include "nxbase/colorvector.h"
#include "nxbase/finegrid.h"
#include "report.h"

namespace nxcolor {
namespace {

// The colour of a table's spectra at their own interval when they are finer
// than 10 nm; empty otherwise.
using FineGrid = std::optional<nxbase::FineGridTristimulus>;

FineGrid FineGridOf(const SpectraTable& table, const MeasuringCondition& condition) {
    FineGrid fine;
    if (table.fineGrid) fine.emplace(condition, table.sourceWavelengths);
    return fine;
}

// CIELAB of a spectrum, whatever the process-wide Lab type.
nxbase::LabValue LabOf(const SpectrumRow& row, const MeasuringCondition& condition,
                       const FineGrid& fine) {
    if (fine && row.native.size() == fine->Wavelengths().size()) {
        const std::array<double, 3> lab = fine->ToLab(row.native.data());
        return {lab[0], lab[1], lab[2]};
    }
    const ReflectanceSpectrum spectrum(row.values.data(), PhysicalConditions());
    const LABVector lab(spectrum, condition);
    const LABVector cie = lab.GetLabVectorColorSpace() == LAB_CIE1976 ? lab : lab.GetCIELab();
    return nxbase::ToLabValue(cie);
}

// The key a row pairs by: SAMPLE_ID when the file has one, else the whole id.
const std::string& PairKey(const SpectrumRow& row) {
    return row.sampleId.empty() ? row.id : row.sampleId;
}

ComparedPair ComparePair(const SpectrumRow& reference, const SpectrumRow& sample,
                         const MeasuringCondition& condition, nxbase::DeltaEMethod method,
                         const FineGrid& referenceGrid, const FineGrid& sampleGrid) {
    const nxbase::LabValue r = LabOf(reference, condition, referenceGrid);
    const nxbase::LabValue s = LabOf(sample, condition, sampleGrid);
    ComparedPair pair;
    pair.id = sample.id;
    const float a[3] = {static_cast<float>(s.L), static_cast<float>(s.a), static_cast<float>(s.b)};
    const float b[3] = {static_cast<float>(r.L), static_cast<float>(r.a), static_cast<float>(r.b)};
    float parts[3];
    dLCHVector::Decompose(a, b, parts);
    pair.dL = parts[0];
    pair.dC = parts[1];
    pair.dH = parts[2];
    pair.dE = nxbase::DeltaE(r, s, method);
    return pair;
}

void Summarise(Comparison* comparison, double tolerance) {
    if (comparison->pairs.empty()) return;
    std::vector<double> values;
    for (const ComparedPair& pair : comparison->pairs) {
        values.push_back(pair.dE);
        if (tolerance >= 0.0 && pair.dE > tolerance) ++comparison->overTolerance;
    }
    comparison->mean =
        std::accumulate(values.begin(), values.end(), 0.0) / static_cast<double>(values.size());
    std::sort(values.begin(), values.end());
    comparison->max = values.back();
    // Nearest rank: the smallest value with at least 95 % of the pairs at or below it.
    const std::size_t rank =
        static_cast<std::size_t>(std::ceil(0.95 * static_cast<double>(values.size())));
    comparison->percentile95 = values[std::max<std::size_t>(rank, 1) - 1];
}

}  // namespace

Comparison Compare(const SpectraTable& reference, const SpectraTable& sample,
                   const MeasuringCondition& condition, const CompareOptions& options) {
    Comparison comparison;
    const FineGrid referenceGrid = FineGridOf(reference, condition);
    const FineGrid sampleGrid = FineGridOf(sample, condition);
    if (options.byOrder) {
        const std::size_t n = std::min(reference.rows.size(), sample.rows.size());
        for (std::size_t i = 0; i < n; ++i) {
            comparison.pairs.push_back(ComparePair(reference.rows[i], sample.rows[i], condition,
                                                   options.method, referenceGrid, sampleGrid));
        }
        if (reference.rows.size() != sample.rows.size()) {
            comparison.problems.push_back(std::to_string(reference.rows.size()) +
                                          " references and " + std::to_string(sample.rows.size()) +
                                          " samples; the first " + std::to_string(n) + " compared");
        }
    } else {
        std::map<std::string, const SpectrumRow*> byId;
        for (const SpectrumRow& row : reference.rows) {
            if (!byId.emplace(PairKey(row), &row).second) {
                comparison.problems.push_back("reference id \"" + PairKey(row) +
                                              "\" appears twice; the first is used");
            }
        }
        for (const SpectrumRow& row : sample.rows) {
            const auto match = byId.find(PairKey(row));
            if (match == byId.end()) {
                comparison.problems.push_back("sample \"" + row.id +
                                              "\" has no reference of id \"" + PairKey(row) +
                                              "\" (--by-order pairs by position)");
                continue;
            }
            comparison.pairs.push_back(ComparePair(*match->second, row, condition, options.method,
                                                   referenceGrid, sampleGrid));
        }
    }
    Summarise(&comparison, options.tolerance);
    return comparison;
}

void WriteComparison(const Comparison& comparison, const CompareOptions& options,
                     const std::string& header, std::ostream& out) {
    const std::string name = nxbase::DeltaEMethodName(options.method);
    const int p = options.precision;
    if (options.csv) {
        out << "id,dL*,dC*,dH*," << name << '\n';
        for (const ComparedPair& pair : comparison.pairs) {
            const bool quote = pair.id.find_first_of(",\"") != std::string::npos;
            std::string id = pair.id;
            if (quote) {
                id.clear();
                for (char c : pair.id) id += c == '"' ? std::string("\"\"") : std::string(1, c);
                id = "\"" + id + "\"";
            }
            out << id << ',' << FormatNumber(pair.dL, p) << ',' << FormatNumber(pair.dC, p) << ','
                << FormatNumber(pair.dH, p) << ',' << FormatNumber(static_cast<float>(pair.dE), p)
                << '\n';
        }
        return;
    }
    out << "# " << header << '\n';
    std::size_t idWidth = 2;
    for (const ComparedPair& pair : comparison.pairs) idWidth = std::max(idWidth, pair.id.size());
    const std::size_t width = std::max<std::size_t>(8, name.size());
    auto cell = [&out, width](const std::string& text) {
        out << "  " << std::string(width > text.size() ? width - text.size() : 0, ' ') << text;
    };
    out << "id" << std::string(idWidth - 2, ' ');
    for (const char* column : {"dL*", "dC*", "dH*"}) cell(column);
    cell(name);
    out << '\n';
    for (const ComparedPair& pair : comparison.pairs) {
        out << pair.id << std::string(idWidth - pair.id.size(), ' ');
        for (const float v : {pair.dL, pair.dC, pair.dH}) cell(FormatNumber(v, p));
        cell(FormatNumber(static_cast<float>(pair.dE), p));
        out << '\n';
    }
}

std::vector<std::string> SummaryLines(const Comparison& comparison, const CompareOptions& options) {
    const std::string name = nxbase::DeltaEMethodName(options.method);
    const int p = options.precision;
    auto number = [p](double v) { return FormatNumber(static_cast<float>(v), p); };
    std::vector<std::string> lines;
    lines.push_back(std::to_string(comparison.pairs.size()) + " pairs: mean " + name + " " +
                    number(comparison.mean) + ", max " + number(comparison.max) +
                    ", 95th percentile " + number(comparison.percentile95));
    std::vector<const ComparedPair*> worst;
    for (const ComparedPair& pair : comparison.pairs) worst.push_back(&pair);
    std::stable_sort(worst.begin(), worst.end(),
                     [](const ComparedPair* a, const ComparedPair* b) { return a->dE > b->dE; });
    if (!worst.empty()) {
        std::string line = "worst:";
        for (std::size_t i = 0; i < std::min(options.worstShown, worst.size()); ++i) {
            line += (i ? ", " : " ") + worst[i]->id + " (" + number(worst[i]->dE) + ")";
        }
        lines.push_back(line);
    }
    if (options.tolerance >= 0.0) {
        lines.push_back(std::to_string(comparison.overTolerance) + " of " +
                        std::to_string(comparison.pairs.size()) + " pairs above the tolerance " +
                        number(options.tolerance));
    }
    return lines;
}

}  // namespace nxcolor
