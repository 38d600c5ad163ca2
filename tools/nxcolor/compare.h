// nxcolor --compare: samples against their reference (standard), paired by
// id or by order, with dL*, dC*, dH* and a colour difference per pair and a
// summary that scripts can gate on.
#ifndef NXCOLOR_COMPARE_H_
#define NXCOLOR_COMPARE_H_

#include <ostream>
#include <string>
#include <vector>

#include "nxbase/colordiff.h"
#include "nxbase/meascond.h"
#include "spectra_csv.h"

namespace nxcolor {

struct CompareOptions {
    nxbase::DeltaEMethod method = nxbase::DeltaEMethod::kCiede2000;
    bool byOrder = false;
    double tolerance = -1.0;  // < 0: none
    int precision = 2;
    bool csv = false;
    std::size_t worstShown = 3;
};

struct ComparedPair {
    std::string id;
    float dL = 0.0f, dC = 0.0f, dH = 0.0f;  // CIELAB, sample minus reference
    double dE = 0.0;
};

struct Comparison {
    std::vector<ComparedPair> pairs;
    std::vector<std::string> problems;  // unpaired samples, duplicate ids
    double mean = 0.0;
    double max = 0.0;
    double percentile95 = 0.0;  // nearest rank
    std::size_t overTolerance = 0;
};

Comparison Compare(const SpectraTable& reference, const SpectraTable& sample,
                   const MeasuringCondition& condition, const CompareOptions& options);

void WriteComparison(const Comparison& comparison, const CompareOptions& options,
                     const std::string& header, std::ostream& out);

// "N pairs: mean ..., max ..., 95th percentile ...", the worst pairs, and
// how many exceed the tolerance.
std::vector<std::string> SummaryLines(const Comparison& comparison, const CompareOptions& options);

}  // namespace nxcolor

#endif  // NXCOLOR_COMPARE_H_
