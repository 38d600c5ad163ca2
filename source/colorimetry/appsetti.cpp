#include "nxbase/appsetti.h"

#include <charconv>
#include <string>
#include <string_view>
#include <system_error>
#include <utility>

#include "nxbase/appconfig.h"
#include "toolkit/string.h"

namespace {

const char* const kGroup = "Settings";
const char* const kIllum1 = "MetamerieTL1";
const char* const kIllum2 = "MetamerieTL2";
const char* const kDirectLightPart = "DirectLightPart";
const char* const kDisplay = "MeasurementDisplay";
constexpr double kDefaultDirectLightPart = 0.5;

// The whole text as a decimal number without locale, an optional "+" first
// (a hand-edited file may carry one); `fallback` when it is not one.
double ParseDouble(std::string_view text, double fallback) {
    double value = fallback;
    return toolkit::ParseWholeDecimal(text, value, true) ? value : fallback;
}

std::string FormatFixed2(double value) {
    char buffer[64];
    auto [end, error] =
        std::to_chars(buffer, buffer + sizeof buffer, value, std::chars_format::fixed, 2);
    if (error != std::errc()) return "0.50";
    return std::string(buffer, end);
}

String DisplayText(NxSetting::MeasurementDisplay display) {
    return String(display == NxSetting::EYE ? "Eye" : "Instrument");
}

}  // namespace

NxSetting* NxSetting::smInstance = nullptr;

NxSetting::NxSetting() : NxSingleton("NxSetting") {}

NxSetting::~NxSetting() {
    if (smInstance == this) smInstance = nullptr;
}

NxSetting* NxSetting::Instance() {
    return nxbase::LazySingletonInstance(smInstance, [](NxSetting& s) { s.LoadProperties(); });
}

void NxSetting::LoadProperties() {
    if (!UserConfig::IsInitialized()) return;
    UserConfig* user = UserConfig::Instance();
    amIllum1 = IllumClass(user->ReadKey(kGroup, kIllum1, String()).str());
    amIllum2 = IllumClass(user->ReadKey(kGroup, kIllum2, String()).str());
    amDirectLightPart = ParseDouble(user->ReadKey(kGroup, kDirectLightPart, String("0.5")).str(),
                                    kDefaultDirectLightPart);
    String display = user->ReadKey(kGroup, kDisplay, DisplayText(amDisplay));
    amDisplay = display == "Eye" ? EYE : INSTRUMENT;
}

void NxSetting::SaveProperties() {
    if (!UserConfig::IsInitialized()) return;
    UserConfig* user = UserConfig::Instance();
    user->WriteKey(kGroup, kIllum1, String(amIllum1.GetName()));
    user->WriteKey(kGroup, kIllum2, String(amIllum2.GetName()));
    user->WriteKey(kGroup, kDirectLightPart, String(FormatFixed2(amDirectLightPart)));
    user->WriteKey(kGroup, kDisplay, DisplayText(amDisplay));
}

void NxSetting::GetIllumClasses(IllumClass& axFirst, IllumClass& axSecond) const {
    axFirst = amIllum1;
    axSecond = amIllum2;
}

void NxSetting::SetIllumClasses(IllumClass axFirst, IllumClass axSecond) {
    amIllum1 = std::move(axFirst);
    amIllum2 = std::move(axSecond);
}
