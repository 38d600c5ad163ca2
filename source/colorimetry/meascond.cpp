#include "nxbase/meascond.h"

#include <cmath>
#include <map>
#include <mutex>

#include "named_types.h"
#include "nxbase/spectrum.h"

namespace {

using klume::cmetry::DensityStandardRepository;
using klume::cmetry::IDensityStandard;

struct FilterName {
    ValueFilterType type;
    const char* name;
};

// Accepted names; the first of a type is the one written.
constexpr FilterName kFilterNames[] = {
    {FILTER_NO, "No"},       {FILTER_POL, "Pol"},     {FILTER_D65, "D65"},
    {FILTER_UV, "UV"},       {FILTER_UVCUT, "UVCut"}, {FILTER_CUSTOM, "Custom"},
    {FILTER_CUSTOM, "Cust"}, {FILTER_REPRO, "Repro"}, {FILTER_D8T, "D8t"},
    {FILTER_D8E, "D8e"},     {FILTER_D8I, "D8i"},     {FILTER_DEFAULT, "Default"},
};

struct DisplayNames {
    std::mutex mutex;
    std::map<ValueFilterType, String> names;
};

DisplayNames& GetDisplayNames() {
    static DisplayNames table;
    return table;
}

String FilterTypeName(ValueFilterType type) {
    for (const FilterName& entry : kFilterNames) {
        if (entry.type == type) return String(entry.name);
    }
    return String::CreateFromInt(static_cast<long>(type));
}

constexpr nxbase::detail::NamedType<DStdType> kDStdNames[] = {
    {DSTD_STATUS_A, "Status A"}, {DSTD_STATUS_T, "Status T"}, {DSTD_DIN, "DIN"},
    {DSTD_DIN_NB, "DIN NB"},     {DSTD_SPI, "SPI"},           {DSTD_STATUS_M, "Status M"},
    {DSTD_STATUS_E, "Status E"}, {DSTD_STATUS_I, "Status I"},
};

}  // namespace

// ---------------------------------------------------------------------------
// ActualFilterClass

ActualFilterClass::ActualFilterClass(ValueFilterType type) : amType(type) {}

ActualFilterClass::ActualFilterClass(const String& name) {
    for (const FilterName& entry : kFilterNames) {
        if (name == entry.name) {
            amType = entry.type;
            return;
        }
    }
    for (const FilterName& entry : kFilterNames) {
        if (name.EqualsIgnoreCaseAscii(String(entry.name))) {
            amType = entry.type;
            return;
        }
    }
    amType = FILTER_DEFAULT;
}

ActualFilterClass::operator String() const {
    return FilterTypeName(amType);
}

ActualFilterClass::Geometry ActualFilterClass::GetGeometry() const {
    switch (amType) {
        case FILTER_NO:
        case FILTER_POL:
        case FILTER_D65:
        case FILTER_UV:
        case FILTER_UVCUT:
        case FILTER_CUSTOM:
        case FILTER_REPRO:
            return GEOMETRY_45_0;
        case FILTER_D8T:
            return GEOMETRY_D8T;
        case FILTER_D8E:
            return GEOMETRY_D8E;
        case FILTER_D8I:
            return GEOMETRY_D8I;
        default:
            return GEOMETRY_UNDEFINED;
    }
}

String ActualFilterClass::GetDisplayName(ValueFilterType type) {
    DisplayNames& table = GetDisplayNames();
    {
        std::lock_guard<std::mutex> lock(table.mutex);
        const auto it = table.names.find(type);
        if (it != table.names.end()) return it->second;
    }
    return FilterTypeName(type);
}

void ActualFilterClass::SetDisplayFilterName(ValueFilterType type, const String& name) {
    DisplayNames& table = GetDisplayNames();
    std::lock_guard<std::mutex> lock(table.mutex);
    table.names[type] = name;
}

// ---------------------------------------------------------------------------
// WBaseClass, PhysicalConditions

WBaseClass::WBaseClass(StoredWBaseType type) : amType(type) {}

WBaseClass::WBaseClass(const String& name)
    : amType(name.EqualsIgnoreCaseAscii(String("Paper")) ? WBASE_PAPER : WBASE_ABSOLUTE) {}

WBaseClass::operator String() const {
    return String(amType == WBASE_PAPER ? "Paper" : "Absolute");
}

PhysicalConditions::operator String() const {
    String text = static_cast<String>(amFilter);
    text += ",";
    text += static_cast<String>(amWBase);
    text += ",";
    text += String::CreateFromInt(static_cast<long>(amSurface));
    return text;
}

// ---------------------------------------------------------------------------
// DStdClass

DStdClass::DStdClass() : amStandard(DensityStandardRepository::GetDefault()) {}

DStdClass::DStdClass(DStdType type) {
    const std::string name = NameOfType(type);
    amStandard = name.empty() ? DensityStandardRepository::GetDefault()
                              : DensityStandardRepository::Get(name);
}

DStdClass::DStdClass(const std::string& name) : amStandard(DensityStandardRepository::Get(name)) {}

DStdClass::DStdClass(boost::shared_ptr<IDensityStandard> standard)
    : amStandard(standard ? std::move(standard) : DensityStandardRepository::GetDefault()) {}

std::string DStdClass::GetName() const {
    return amStandard->GetName();
}

std::string DStdClass::GetDisplayString() const {
    return amStandard->GetName();
}

DStdType DStdClass::GetDStdType() const {
    return nxbase::detail::TypeNamed(kDStdNames, amStandard->GetName(), DSTD_UNKNOWN);
}

std::string DStdClass::NameOfType(DStdType type) {
    return nxbase::detail::NameOf(kDStdNames, type);
}

// ---------------------------------------------------------------------------
// MeasuringCondition

MeasuringCondition::MeasuringCondition(const IllumClass& illuminant, const ObserverClass& observer,
                                       const PhysicalConditions& physical)
    : amIllum(illuminant), amObserver(observer), amPhysical(physical) {}

MeasuringCondition::MeasuringCondition(const DStdClass& standard,
                                       const PhysicalConditions& physical)
    : amDStd(standard), amPhysical(physical) {}

MeasuringCondition::MeasuringCondition(const IllumClass& illuminant, const ObserverClass& observer,
                                       const DStdClass& standard,
                                       const PhysicalConditions& physical)
    : amIllum(illuminant), amObserver(observer), amDStd(standard), amPhysical(physical) {}

std::string MeasuringCondition::GetMeasuringConditionString() const {
    std::string text =
        amIllum.GetIllumType() == ILLUM_UNKNOWN ? std::string("?") : amIllum.GetDisplayString();
    text += ",";
    text += amObserver.GetObserverType() == OBSERVER_UNKNOWN
                ? std::string("?")
                : static_cast<String>(amObserver).str();
    return text;
}

MeasuringCondition::operator String() const {
    std::string text = GetMeasuringConditionString();
    text += ",";
    text += amDStd.GetDisplayString();
    text += ",";
    text += static_cast<String>(amPhysical).str();
    return String(text);
}

bool MeasuringCondition::operator==(const MeasuringCondition& other) const {
    return amIllum == other.amIllum && amObserver == other.amObserver && amDStd == other.amDStd &&
           amPhysical == other.amPhysical;
}

// ---------------------------------------------------------------------------
// DichteFilter

DichteFilter::DichteFilter() : DichteFilter(DStdClass()) {}

DichteFilter::DichteFilter(const DStdClass& standard) : amDStd(standard) {
    const boost::shared_ptr<IDensityStandard> products = amDStd.GetDensityStandard();
    const int channels = products->GetChannelCount();
    amFilters.reserve(static_cast<std::size_t>(channels));
    for (int c = 0; c < channels; ++c) {
        const klume::cmetry::SampleTable& table = products->GetProducts(c);
        float weights[Filter::kSize];
        for (int i = 0; i < Filter::kSize; ++i) weights[i] = static_cast<float>(table[i]);
        amFilters.emplace_back(weights);
    }
}

bool DichteFilter::GetDensity(const Spectrum& spectrum, unsigned short channel,
                              float& density) const {
    if (channel >= amFilters.size()) return false;
    const float* weights = amFilters[channel].GetWeights();
    double weighted = 0.0;
    double total = 0.0;
    for (int i = 0; i < Filter::kSize; ++i) {
        weighted += static_cast<double>(weights[i]) * static_cast<double>(spectrum[i]);
        total += static_cast<double>(weights[i]);
    }
    if (!(weighted > 0.0) || !(total > 0.0)) return false;
    density = static_cast<float>(-std::log10(weighted / total));
    return true;
}
