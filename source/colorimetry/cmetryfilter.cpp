#include "nxbase/cmetryfilter.h"

#include <algorithm>
#include <cctype>
#include <mutex>
#include <stdexcept>

#include "named_types.h"
#include "nxbase/logfile.h"

namespace {

using klume::cmetry::IIlluminant;
using klume::cmetry::IlluminantRepository;
using klume::cmetry::IObserver;
using klume::cmetry::ObserverRepository;

constexpr nxbase::detail::NamedType<IllumType> kIllumNames[] = {
    {ILLUM_A, "A"},     {ILLUM_C, "C"},       {ILLUM_D65, "D65"},   {ILLUM_D50, "D50"},
    {ILLUM_FL1, "FL1"}, {ILLUM_FL2, "FL2"},   {ILLUM_FL3, "FL3"},   {ILLUM_FL4, "FL4"},
    {ILLUM_FL5, "FL5"}, {ILLUM_FL6, "FL6"},   {ILLUM_FL7, "FL7"},   {ILLUM_FL8, "FL8"},
    {ILLUM_FL9, "FL9"}, {ILLUM_FL10, "FL10"}, {ILLUM_FL11, "FL11"}, {ILLUM_FL12, "FL12"},
    {ILLUM_D55, "D55"}, {ILLUM_D75, "D75"},   {ILLUM_E, "E"},
};

// The data provider's diagnostics go to the process log, always written.
void LogProviderMessage(const std::string& message) {
    LogFile::WriteToLog(String(message), String());
}

// Installed when the library is loaded, before any colour work.
const bool kProviderLogInstalled = (klume::cmetry::SetMessageHandler(&LogProviderMessage), true);

constexpr const char* kObserver2 = "2";
constexpr const char* kObserver10 = "10";

// The degree string appended to observer names; Windows-1252 degree sign.
std::mutex& DegreeMutex() {
    static std::mutex mutex;
    return mutex;
}

String& DegreeString() {
    static String degree("\xB0");
    return degree;
}

ObserverType TypeOfObserverName(const std::string& name) {
    if (name == kObserver2) return OBSERVER_2DEG;
    if (name == kObserver10) return OBSERVER_10DEG;
    return OBSERVER_UNKNOWN;
}

}  // namespace

// ---------------------------------------------------------------------------
// IllumClass

IllumClass::IllumClass() : amIlluminant(IlluminantRepository::GetDefault()) {}

IllumClass::IllumClass(IllumType type, short /*variant*/) {
    const std::string name = NameOfType(type);
    amIlluminant =
        name.empty() ? IlluminantRepository::GetDefault() : IlluminantRepository::Get(name);
}

IllumClass::IllumClass(const std::string& name) : amIlluminant(IlluminantRepository::Get(name)) {}

IllumClass::IllumClass(boost::shared_ptr<IIlluminant> illuminant)
    : amIlluminant(illuminant ? std::move(illuminant) : IlluminantRepository::GetDefault()) {}

IllumClass::IllumClass(IIlluminant& illuminant) {
    // Share the repository's object when it is that one; otherwise keep a copy
    // of the table, since the caller owns `illuminant`.
    boost::shared_ptr<IIlluminant> known = IlluminantRepository::Find(illuminant.GetName());
    if (known.get() == &illuminant) {
        amIlluminant = known;
        return;
    }
    amIlluminant =
        klume::cmetry::MakeIlluminant(illuminant.GetName(), illuminant.GetDescription(),
                                      illuminant.GetWavelengths(), illuminant.GetPowers());
    if (!amIlluminant) amIlluminant = IlluminantRepository::GetDefault();
}

std::string IllumClass::GetName() const {
    return amIlluminant->GetName();
}

std::string IllumClass::GetDisplayString() const {
    return amIlluminant->GetName();
}

IllumType IllumClass::GetIllumType() const {
    return nxbase::detail::TypeNamed(kIllumNames, amIlluminant->GetName(), ILLUM_UNKNOWN);
}

std::string IllumClass::NameOfType(IllumType type) {
    return nxbase::detail::NameOf(kIllumNames, type);
}

// ---------------------------------------------------------------------------
// ObserverClass

ObserverClass::ObserverClass(ObserverType type) {
    switch (type) {
        case OBSERVER_2DEG:
            amName = kObserver2;
            break;
        case OBSERVER_10DEG:
            amName = kObserver10;
            break;
        default:
            amType = OBSERVER_UNKNOWN;
            amName = String::CreateFromInt(static_cast<long>(type));
            amObserver = ObserverRepository::GetDefault();
            return;
    }
    amType = type;
    amObserver = ObserverRepository::Get(amName.str());
}

ObserverClass::ObserverClass(const String& name) {
    // The leading digits name the observer; a degree sign or "deg" may follow.
    const std::string& text = name.str();
    std::size_t digits = 0;
    while (digits < text.size() && std::isdigit(static_cast<unsigned char>(text[digits]))) {
        ++digits;
    }
    const std::string number = text.substr(0, digits);
    amType = TypeOfObserverName(number);
    if (amType == OBSERVER_UNKNOWN) {
        amName = name;
        amObserver = ObserverRepository::GetDefault();
    } else {
        amName = number;
        amObserver = ObserverRepository::Get(number);
    }
}

ObserverClass::ObserverClass(boost::shared_ptr<IObserver> observer) {
    if (!observer) {
        amType = OBSERVER_UNKNOWN;
        amName = "?";
        amObserver = ObserverRepository::GetDefault();
        return;
    }
    amName = observer->GetName();
    amType = TypeOfObserverName(observer->GetName());
    amObserver = std::move(observer);
}

ObserverClass::operator String() const {
    String text(amName);
    text += GetDegreeString();
    return text;
}

String ObserverClass::GetDegreeString() {
    std::lock_guard<std::mutex> lock(DegreeMutex());
    return DegreeString();
}

void ObserverClass::SetDegreeString(const String& degree) {
    std::lock_guard<std::mutex> lock(DegreeMutex());
    DegreeString() = degree;
}

// ---------------------------------------------------------------------------
// Filter

Filter::Filter() = default;

Filter::Filter(const float* weights) {
    std::copy(weights, weights + kSize, amWeights);
    amDefined = 1;
    CalculateSumme();
}

void Filter::Init(float value) {
    std::fill(amWeights, amWeights + kSize, value);
    CalculateSumme();
}

void Filter::CalculateSumme() {
    float sum = 0.0f;
    for (float w : amWeights) sum += w;
    amSumme = sum;
    amSumValid = 1;
}

float Filter::FilterSumme() {
    if (!amSumValid) CalculateSumme();
    return amSumme;
}

float Filter::FilterSumme() const {
    if (amSumValid) return amSumme;
    float sum = 0.0f;
    for (float w : amWeights) sum += w;
    return sum;
}

float Filter::operator*(const std::vector<float>& values) const {
    if (values.size() < static_cast<std::size_t>(kSize)) {
        throw std::logic_error("Illegal spectrum size");
    }
    return Dot(values.data());
}

float Filter::Dot(const float* values) const {
    float sum = 0.0f;
    for (int i = 0; i < kSize; ++i) sum += amWeights[i] * values[i];
    return sum;
}

Filter Filter::FilterXFilter(const Filter& other) const {
    float products[kSize];
    for (int i = 0; i < kSize; ++i) products[i] = amWeights[i] * other.amWeights[i];
    return Filter(products);
}

// ---------------------------------------------------------------------------
// CMetryFilter

CMetryFilter::CMetryFilter() {
    Build(IlluminantRepository::Get("D65"), ObserverRepository::Get(kObserver2));
}

CMetryFilter::CMetryFilter(const Lichtart& illuminant, const Observer& observer) {
    Build(illuminant.GetIlluminant(), observer.GetObserver());
}

void CMetryFilter::Build(boost::shared_ptr<IIlluminant> illuminant,
                         boost::shared_ptr<IObserver> observer) {
    if (!observer) observer = ObserverRepository::GetDefault();
    if (!illuminant) illuminant = IlluminantRepository::GetDefault();
    amFilter = klume::cmetry::CMetryFilter::Find(illuminant, observer);
    if (!amFilter) {
        LogFile::WriteToLog(
            String("Illuminant \"" + illuminant->GetName() + "\" has no weights; using \"" +
                   IlluminantRepository::GetDefault()->GetName() + "\""),
            String());
        amFilter = klume::cmetry::CMetryFilter::Find(IlluminantRepository::GetDefault(), observer);
    }
    for (unsigned short c = 0; c < 3; ++c) {
        amFilters[c].reset(new Filter(amFilter->GetFloatWeights(c)));
    }
}

void CMetryFilter::Tristimulus(const float* values, float sums[3]) const {
    const float* wx = amFilters[0]->GetWeights();
    const float* wy = amFilters[1]->GetWeights();
    const float* wz = amFilters[2]->GetWeights();
    float x = 0.0f;
    float y = 0.0f;
    float z = 0.0f;
    for (int i = 0; i < Filter::kSize; ++i) {
        x += wx[i] * values[i];
        y += wy[i] * values[i];
        z += wz[i] * values[i];
    }
    sums[0] = x;
    sums[1] = y;
    sums[2] = z;
}

ObserverClass CMetryFilter::GetObserver() const {
    return ObserverClass(amFilter->GetObserver());
}

IllumClass CMetryFilter::GetIllum() const {
    return IllumClass(amFilter->GetIlluminant());
}
